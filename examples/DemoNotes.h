// What both sync demos show of a note: its status by name, the note as a
// device or the server holds it, and the closing side-by-side table.
#pragma once

#include <cstdio>
#include <set>
#include <string>
#include <vector>

namespace demo {

inline std::string statusName(int status) {
    switch (status) {
        case 1: return "PENDING";
        case 2: return "SENT";
        case 3: return "PERSISTED";
    }
    return "status " + std::to_string(status);
}

struct Note {
    std::string key;
    std::string text;
    int status = 0;
    bool operator==(const Note& other) const { return key == other.key && text == other.text && status == other.status; }
    bool operator!=(const Note& other) const { return !(*this == other); }
};

// One row per note key, one column per device (text and status) and a last
// column for the server (text only); "-" where a column lacks the note.
inline void printNotesTable(const std::vector<std::string>& deviceNames, const std::vector<std::vector<Note>>& columns) {
    std::set<std::string> keys;
    for (const auto& column : columns) {
        for (const Note& note : column) keys.insert(note.key);
    }
    std::printf("\n%-8s", "note");
    for (const std::string& name : deviceNames) std::printf(" | %-30s", name.c_str());
    std::printf(" | %s\n", "server");
    for (const std::string& key : keys) {
        std::printf("%-8s", key.c_str());
        for (size_t c = 0; c < columns.size(); ++c) {
            std::string cell = "-";
            for (const Note& note : columns[c]) {
                if (note.key != key) continue;
                cell = "\"" + note.text + "\"";
                if (c < deviceNames.size()) cell += " " + statusName(note.status);
            }
            std::printf(c + 1 < columns.size() ? " | %-30s" : " | %s", cell.c_str());
        }
        std::printf("\n");
    }
}

}  // namespace demo
