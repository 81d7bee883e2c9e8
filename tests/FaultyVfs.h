// A SQLite VFS for tests that wraps the default one and, on demand, fails
// every write as a full disk or an I/O error would. Registered as the
// default VFS while the object lives, so a store opened meanwhile uses it;
// the previous default comes back when it goes. One at a time per process;
// destroy it only after every database opened through it is closed.
#pragma once

#include <sqlite3.h>

#include <atomic>

namespace testsupport {

class FaultyVfs {
public:
    // The result code a failing write returns.
    enum class Fault { NONE = SQLITE_OK, IO_ERROR = SQLITE_IOERR_WRITE, DISK_FULL = SQLITE_FULL };

    FaultyVfs();
    ~FaultyVfs();
    FaultyVfs(const FaultyVfs&) = delete;
    FaultyVfs& operator=(const FaultyVfs&) = delete;

    // From now on every write fails with fault (NONE: writes work again).
    // Any thread, also from inside a store callback.
    static void inject(Fault fault) { current = fault; }
    static int currentFault() { return static_cast<int>(current.load()); }

private:
    static inline std::atomic<Fault> current{Fault::NONE};
    sqlite3_vfs* real = nullptr;
    sqlite3_vfs vfs{};
};

}  // namespace testsupport
