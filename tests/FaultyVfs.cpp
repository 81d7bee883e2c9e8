#include "FaultyVfs.h"

#include <cstring>

namespace testsupport {

namespace {

// The real file lives right behind the wrapper, in the memory SQLite gives.
struct FaultyFile {
    sqlite3_file base;
    sqlite3_file* real() { return reinterpret_cast<sqlite3_file*>(this + 1); }
};

sqlite3_file* realOf(sqlite3_file* file) { return reinterpret_cast<FaultyFile*>(file)->real(); }

int xClose(sqlite3_file* f) { return realOf(f)->pMethods->xClose(realOf(f)); }
int xRead(sqlite3_file* f, void* data, int amount, sqlite3_int64 offset) {
    return realOf(f)->pMethods->xRead(realOf(f), data, amount, offset);
}
int xWrite(sqlite3_file* f, const void* data, int amount, sqlite3_int64 offset) {
    if (FaultyVfs::currentFault() != SQLITE_OK) return FaultyVfs::currentFault();
    return realOf(f)->pMethods->xWrite(realOf(f), data, amount, offset);
}
int xTruncate(sqlite3_file* f, sqlite3_int64 size) { return realOf(f)->pMethods->xTruncate(realOf(f), size); }
int xSync(sqlite3_file* f, int flags) { return realOf(f)->pMethods->xSync(realOf(f), flags); }
int xFileSize(sqlite3_file* f, sqlite3_int64* size) { return realOf(f)->pMethods->xFileSize(realOf(f), size); }
int xLock(sqlite3_file* f, int level) { return realOf(f)->pMethods->xLock(realOf(f), level); }
int xUnlock(sqlite3_file* f, int level) { return realOf(f)->pMethods->xUnlock(realOf(f), level); }
int xCheckReservedLock(sqlite3_file* f, int* out) { return realOf(f)->pMethods->xCheckReservedLock(realOf(f), out); }
int xFileControl(sqlite3_file* f, int op, void* arg) { return realOf(f)->pMethods->xFileControl(realOf(f), op, arg); }
int xSectorSize(sqlite3_file* f) { return realOf(f)->pMethods->xSectorSize(realOf(f)); }
int xDeviceCharacteristics(sqlite3_file* f) { return realOf(f)->pMethods->xDeviceCharacteristics(realOf(f)); }
int xShmMap(sqlite3_file* f, int region, int size, int extend, void volatile** out) {
    return realOf(f)->pMethods->xShmMap(realOf(f), region, size, extend, out);
}
int xShmLock(sqlite3_file* f, int offset, int n, int flags) {
    return realOf(f)->pMethods->xShmLock(realOf(f), offset, n, flags);
}
void xShmBarrier(sqlite3_file* f) { realOf(f)->pMethods->xShmBarrier(realOf(f)); }
int xShmUnmap(sqlite3_file* f, int deleteFlag) { return realOf(f)->pMethods->xShmUnmap(realOf(f), deleteFlag); }
// No memory-mapped reads: every page then goes through xRead.
int xFetch(sqlite3_file*, sqlite3_int64, int, void** out) {
    *out = nullptr;
    return SQLITE_OK;
}
int xUnfetch(sqlite3_file*, sqlite3_int64, void*) { return SQLITE_OK; }

const sqlite3_io_methods kMethods = {3,         xClose,         xRead,       xWrite,      xTruncate,
                                     xSync,     xFileSize,      xLock,       xUnlock,     xCheckReservedLock,
                                     xFileControl, xSectorSize, xDeviceCharacteristics, xShmMap, xShmLock,
                                     xShmBarrier, xShmUnmap,    xFetch,      xUnfetch};

sqlite3_vfs* realVfs(sqlite3_vfs* vfs) { return static_cast<sqlite3_vfs*>(vfs->pAppData); }

int xOpen(sqlite3_vfs* vfs, const char* name, sqlite3_file* file, int flags, int* outFlags) {
    FaultyFile* wrapper = reinterpret_cast<FaultyFile*>(file);
    wrapper->base.pMethods = nullptr;
    int rc = realVfs(vfs)->xOpen(realVfs(vfs), name, wrapper->real(), flags, outFlags);
    // Without real methods the file is not open, and SQLite must not close it.
    if (wrapper->real()->pMethods != nullptr) wrapper->base.pMethods = &kMethods;
    return rc;
}
int xDelete(sqlite3_vfs* vfs, const char* name, int syncDir) {
    return realVfs(vfs)->xDelete(realVfs(vfs), name, syncDir);
}
int xAccess(sqlite3_vfs* vfs, const char* name, int flags, int* out) {
    return realVfs(vfs)->xAccess(realVfs(vfs), name, flags, out);
}
int xFullPathname(sqlite3_vfs* vfs, const char* name, int size, char* out) {
    return realVfs(vfs)->xFullPathname(realVfs(vfs), name, size, out);
}
int xRandomness(sqlite3_vfs* vfs, int size, char* out) { return realVfs(vfs)->xRandomness(realVfs(vfs), size, out); }
int xSleep(sqlite3_vfs* vfs, int micros) { return realVfs(vfs)->xSleep(realVfs(vfs), micros); }
int xCurrentTime(sqlite3_vfs* vfs, double* out) { return realVfs(vfs)->xCurrentTime(realVfs(vfs), out); }
int xGetLastError(sqlite3_vfs* vfs, int size, char* out) {
    return realVfs(vfs)->xGetLastError(realVfs(vfs), size, out);
}
int xCurrentTimeInt64(sqlite3_vfs* vfs, sqlite3_int64* out) {
    return realVfs(vfs)->xCurrentTimeInt64(realVfs(vfs), out);
}

}  // namespace

FaultyVfs::FaultyVfs() : real(sqlite3_vfs_find(nullptr)) {
    vfs.iVersion = 2;
    vfs.szOsFile = static_cast<int>(sizeof(FaultyFile)) + real->szOsFile;
    vfs.mxPathname = real->mxPathname;
    vfs.zName = "tessarine_faulty";
    vfs.pAppData = real;
    vfs.xOpen = xOpen;
    vfs.xDelete = xDelete;
    vfs.xAccess = xAccess;
    vfs.xFullPathname = xFullPathname;
    vfs.xRandomness = xRandomness;
    vfs.xSleep = xSleep;
    vfs.xCurrentTime = xCurrentTime;
    vfs.xGetLastError = xGetLastError;
    vfs.xCurrentTimeInt64 = xCurrentTimeInt64;
    inject(Fault::NONE);
    sqlite3_vfs_register(&vfs, 1);
}

FaultyVfs::~FaultyVfs() {
    inject(Fault::NONE);
    sqlite3_vfs_unregister(&vfs);
    sqlite3_vfs_register(real, 1);
}

}  // namespace testsupport
