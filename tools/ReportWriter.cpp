#include "tools/ReportWriter.h"

#include <algorithm>
#include <cstdio>
#include <iomanip>

#include "tools/JsonWriter.h"

namespace lumivale {
namespace tessarine {
namespace inspect {

namespace {

std::string statusName(int status) {
    switch (status) {
        case 1: return "PENDING";
        case 2: return "SENT";
        case 3: return "PERSISTED";
    }
    return "UNKNOWN(" + std::to_string(status) + ")";
}

std::string typeName(int type) {
    switch (type) {
        case 1: return "SAVE";
        case 2: return "DELETE";
    }
    return "UNKNOWN(" + std::to_string(type) + ")";
}

bool isPrintable(unsigned char c) { return c >= 0x20 && c < 0x7f; }

std::string hexByte(unsigned char c) {
    char digits[3];
    std::snprintf(digits, sizeof digits, "%02x", c);
    return digits;
}

// A byte string for a terminal: printable ASCII kept, the rest as \xHH.
std::string printable(const std::string& bytes) {
    std::string text;
    for (unsigned char c : bytes) {
        if (c == '\\') {
            text += "\\\\";
        } else {
            text += isPrintable(c) ? std::string(1, static_cast<char>(c)) : "\\x" + hexByte(c);
        }
    }
    return text;
}

struct BlobText {
    std::string encoding;  // "text" or "hex"
    std::string content;
};

BlobText blobText(const std::vector<unsigned char>& blob) {
    if (!blob.empty() && std::all_of(blob.begin(), blob.end(), isPrintable)) {
        return {"text", std::string(blob.begin(), blob.end())};
    }
    std::string hex;
    for (unsigned char c : blob) hex += hexByte(c);
    return {"hex", hex};
}

void writeBlobMembers(JsonWriter& json, const std::vector<unsigned char>& blob) {
    BlobText text = blobText(blob);
    json.key("blob_size");
    json.value(static_cast<uint64_t>(blob.size()));
    json.key("blob_encoding");
    json.value(text.encoding);
    json.key("blob");
    json.value(text.content);
}

std::string blobForPeople(const std::vector<unsigned char>& blob) {
    BlobText text = blobText(blob);
    return std::to_string(blob.size()) + " bytes" +
           (blob.empty() ? "" : ", " + text.encoding + " " +
                                    (text.encoding == "text" ? JsonWriter::quote(text.content) : text.content));
}

void summaryText(std::ostream& out, const std::string& path, const StoreSummary& summary) {
    out << "store:        " << path << "\n"
        << "client id:    " << summary.clientId << "\n"
        << "data version: " << summary.dataVersion << "\n"
        << "integrity:    ";
    for (size_t i = 0; i < summary.integrity.size(); ++i) out << (i ? "; " : "") << summary.integrity[i];
    out << "\n\ncollections: " << summary.collections.size() << "\n";
    size_t width = std::string("collection").size();
    for (const auto& c : summary.collections) width = std::max(width, c.name.size());
    auto row = [&](const std::string& name, const std::string& pending, const std::string& sent,
                   const std::string& persisted, const std::string& versionId, const std::string& sequence) {
        out << "  " << std::left << std::setw(static_cast<int>(width)) << name << std::right << std::setw(9) << pending
            << std::setw(6) << sent << std::setw(11) << persisted << std::setw(12) << versionId << std::setw(17)
            << sequence << "\n";
    };
    if (!summary.collections.empty()) row("collection", "PENDING", "SENT", "PERSISTED", "version id", "sequence number");
    for (const auto& c : summary.collections) {
        row(c.name, std::to_string(c.pending), std::to_string(c.sent), std::to_string(c.persisted),
            std::to_string(c.versionIdCounter),
            c.sequenceNumber ? std::to_string(*c.sequenceNumber) : "not subscribed");
    }
    out << "\noutgoing queue: " << summary.queue.length << " change(s), PENDING " << summary.queue.pending << ", SENT "
        << summary.queue.sent << "\n";
    for (const auto& [collection, versionId] : summary.queue.oldestVersionIds) {
        out << "  oldest queued version id of " << collection << ": " << versionId << "\n";
    }
}

void summaryJson(std::ostream& out, const std::string& path, const StoreSummary& summary) {
    JsonWriter json(out);
    json.beginObject();
    json.key("path");
    json.value(path);
    json.key("client_id");
    json.value(summary.clientId);
    json.key("data_version");
    json.value(summary.dataVersion);
    json.key("collections");
    json.beginArray();
    for (const auto& c : summary.collections) {
        json.beginObject();
        json.key("name");
        json.value(c.name);
        json.key("objects");
        json.beginObject();
        json.key("PENDING");
        json.value(c.pending);
        json.key("SENT");
        json.value(c.sent);
        json.key("PERSISTED");
        json.value(c.persisted);
        json.endObject();
        json.key("version_id_counter");
        json.value(c.versionIdCounter);
        json.key("sequence_number");
        if (c.sequenceNumber) {
            json.value(*c.sequenceNumber);
        } else {
            json.null();
        }
        json.endObject();
    }
    json.endArray();
    json.key("queue");
    json.beginObject();
    json.key("length");
    json.value(summary.queue.length);
    json.key("by_status");
    json.beginObject();
    json.key("PENDING");
    json.value(summary.queue.pending);
    json.key("SENT");
    json.value(summary.queue.sent);
    json.endObject();
    json.key("oldest_version_ids");
    json.beginObject();
    for (const auto& [collection, versionId] : summary.queue.oldestVersionIds) {
        json.key(collection);
        json.value(versionId);
    }
    json.endObject();
    json.endObject();
    json.key("integrity_ok");
    json.value(summary.integrityOk());
    json.key("integrity_check");
    json.beginArray();
    for (const auto& line : summary.integrity) json.value(line);
    json.endArray();
    json.endObject();
}

}  // namespace

void writeSummary(std::ostream& out, Format format, const std::string& path, const StoreSummary& summary) {
    if (format == Format::JSON) {
        summaryJson(out, path, summary);
    } else {
        summaryText(out, path, summary);
    }
}

void writeObjects(std::ostream& out, Format format, const std::string& path, const std::string& collection,
                  const std::vector<StoredObject>& objects) {
    if (format == Format::TEXT) {
        out << collection << ": " << objects.size() << " object(s), in sort-key order\n";
        for (const auto& o : objects) {
            out << "  " << printable(o.primaryKey) << "  sort key " << printable(o.sortKey) << "  "
                << statusName(o.status) << "  " << blobForPeople(o.blob) << "\n";
        }
        return;
    }
    JsonWriter json(out);
    json.beginObject();
    json.key("path");
    json.value(path);
    json.key("collection");
    json.value(collection);
    json.key("objects");
    json.beginArray();
    for (const auto& o : objects) {
        json.beginObject();
        json.key("primary_key");
        json.value(o.primaryKey);
        json.key("sort_key");
        json.value(o.sortKey);
        json.key("status");
        json.value(statusName(o.status));
        writeBlobMembers(json, o.blob);
        json.endObject();
    }
    json.endArray();
    json.endObject();
}

void writeQueue(std::ostream& out, Format format, const std::string& path, const std::vector<QueuedDelta>& queue) {
    if (format == Format::TEXT) {
        out << "outgoing queue: " << queue.size() << " change(s), in resend order\n";
        int position = 0;
        for (const auto& d : queue) {
            out << "  " << ++position << ". " << d.collectionName << " version " << d.versionId << "  "
                << typeName(d.type) << " " << printable(d.primaryKey) << "  sort key " << printable(d.sortKey)
                << "  " << statusName(d.status) << "  " << blobForPeople(d.blob) << "\n";
        }
        return;
    }
    JsonWriter json(out);
    json.beginObject();
    json.key("path");
    json.value(path);
    json.key("queue");
    json.beginArray();
    for (const auto& d : queue) {
        json.beginObject();
        json.key("collection");
        json.value(d.collectionName);
        json.key("version_id");
        json.value(d.versionId);
        json.key("type");
        json.value(typeName(d.type));
        json.key("primary_key");
        json.value(d.primaryKey);
        json.key("sort_key");
        json.value(d.sortKey);
        json.key("status");
        json.value(statusName(d.status));
        writeBlobMembers(json, d.blob);
        json.endObject();
    }
    json.endArray();
    json.endObject();
}

}  // namespace inspect
}  // namespace tessarine
}  // namespace lumivale
