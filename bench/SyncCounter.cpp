// A VFS that forwards every call to the default one and counts the xSync calls by the kind of file
// (SQLite turns each into one fsync or fdatasync).
#include "bench/SyncCounter.h"

#include <sqlite3.h>

#include <algorithm>
#include <atomic>
#include <mutex>

namespace axbench {

namespace {

std::atomic<uint64_t> databaseSyncs{0}, logSyncs{0}, otherSyncs{0};
sqlite3_vfs* below = nullptr;

// The counting file: its methods, then the file of the VFS below in the bytes after it.
struct CountingFile {
    sqlite3_file base;
    std::atomic<uint64_t>* counter;
};

sqlite3_file* inner(sqlite3_file* f) {
    return reinterpret_cast<sqlite3_file*>(reinterpret_cast<CountingFile*>(f) + 1);
}
const sqlite3_io_methods& methodsOf(sqlite3_file* f) {
    return *inner(f)->pMethods;
}

int fileClose(sqlite3_file* f) {
    return methodsOf(f).xClose(inner(f));
}
int fileRead(sqlite3_file* f, void* p, int n, sqlite3_int64 at) {
    return methodsOf(f).xRead(inner(f), p, n, at);
}
int fileWrite(sqlite3_file* f, const void* p, int n, sqlite3_int64 at) {
    return methodsOf(f).xWrite(inner(f), p, n, at);
}
int fileTruncate(sqlite3_file* f, sqlite3_int64 size) {
    return methodsOf(f).xTruncate(inner(f), size);
}
int fileSync(sqlite3_file* f, int flags) {
    ++*reinterpret_cast<CountingFile*>(f)->counter;
    return methodsOf(f).xSync(inner(f), flags);
}
int fileSize(sqlite3_file* f, sqlite3_int64* size) {
    return methodsOf(f).xFileSize(inner(f), size);
}
int fileLock(sqlite3_file* f, int level) {
    return methodsOf(f).xLock(inner(f), level);
}
int fileUnlock(sqlite3_file* f, int level) {
    return methodsOf(f).xUnlock(inner(f), level);
}
int fileCheckReserved(sqlite3_file* f, int* out) {
    return methodsOf(f).xCheckReservedLock(inner(f), out);
}
int fileControl(sqlite3_file* f, int op, void* arg) {
    return methodsOf(f).xFileControl(inner(f), op, arg);
}
int fileSectorSize(sqlite3_file* f) {
    return methodsOf(f).xSectorSize(inner(f));
}
int fileCharacteristics(sqlite3_file* f) {
    return methodsOf(f).xDeviceCharacteristics(inner(f));
}
int fileShmMap(sqlite3_file* f, int region, int size, int extend, void volatile** out) {
    return methodsOf(f).xShmMap(inner(f), region, size, extend, out);
}
int fileShmLock(sqlite3_file* f, int offset, int n, int flags) {
    return methodsOf(f).xShmLock(inner(f), offset, n, flags);
}
void fileShmBarrier(sqlite3_file* f) {
    methodsOf(f).xShmBarrier(inner(f));
}
int fileShmUnmap(sqlite3_file* f, int remove) {
    return methodsOf(f).xShmUnmap(inner(f), remove);
}
int fileFetch(sqlite3_file* f, sqlite3_int64 at, int n, void** out) {
    return methodsOf(f).xFetch(inner(f), at, n, out);
}
int fileUnfetch(sqlite3_file* f, sqlite3_int64 at, void* p) {
    return methodsOf(f).xUnfetch(inner(f), at, p);
}

// The counting methods of one version: those the file's own methods have, and no more (a method
// the version below lacks must be absent, not forwarded to nothing).
constexpr sqlite3_io_methods countingMethods(int version) {
    sqlite3_io_methods m{};
    m.iVersion = version;
    m.xClose = fileClose;
    m.xRead = fileRead;
    m.xWrite = fileWrite;
    m.xTruncate = fileTruncate;
    m.xSync = fileSync;
    m.xFileSize = fileSize;
    m.xLock = fileLock;
    m.xUnlock = fileUnlock;
    m.xCheckReservedLock = fileCheckReserved;
    m.xFileControl = fileControl;
    m.xSectorSize = fileSectorSize;
    m.xDeviceCharacteristics = fileCharacteristics;
    if (version >= 2) {
        m.xShmMap = fileShmMap;
        m.xShmLock = fileShmLock;
        m.xShmBarrier = fileShmBarrier;
        m.xShmUnmap = fileShmUnmap;
    }
    if (version >= 3) {
        m.xFetch = fileFetch;
        m.xUnfetch = fileUnfetch;
    }
    return m;
}
const sqlite3_io_methods kMethods[] = {countingMethods(1), countingMethods(2), countingMethods(3)};

int vfsOpen(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* f, int flags, int* outFlags) {
    auto* counting = reinterpret_cast<CountingFile*>(f);
    counting->counter = (flags & SQLITE_OPEN_MAIN_DB) ? &databaseSyncs
                        : (flags & SQLITE_OPEN_WAL)   ? &logSyncs
                                                      : &otherSyncs;
    f->pMethods = nullptr;
    int rc = below->xOpen(below, name, inner(f), flags, outFlags);
    if (const sqlite3_io_methods* own = inner(f)->pMethods) f->pMethods = &kMethods[std::clamp(own->iVersion, 1, 3) - 1];
    return rc;
}
int vfsDelete(sqlite3_vfs*, const char* name, int syncDir) {
    return below->xDelete(below, name, syncDir);
}
int vfsAccess(sqlite3_vfs*, const char* name, int flags, int* out) {
    return below->xAccess(below, name, flags, out);
}
int vfsFullPathname(sqlite3_vfs*, const char* name, int n, char* out) {
    return below->xFullPathname(below, name, n, out);
}
void* vfsDlOpen(sqlite3_vfs*, const char* name) {
    return below->xDlOpen(below, name);
}
void vfsDlError(sqlite3_vfs*, int n, char* out) {
    below->xDlError(below, n, out);
}
void (*vfsDlSym(sqlite3_vfs*, void* handle, const char* symbol))(void) {
    return below->xDlSym(below, handle, symbol);
}
void vfsDlClose(sqlite3_vfs*, void* handle) {
    below->xDlClose(below, handle);
}
int vfsRandomness(sqlite3_vfs*, int n, char* out) {
    return below->xRandomness(below, n, out);
}
int vfsSleep(sqlite3_vfs*, int micros) {
    return below->xSleep(below, micros);
}
int vfsCurrentTime(sqlite3_vfs*, double* out) {
    return below->xCurrentTime(below, out);
}
int vfsGetLastError(sqlite3_vfs*, int n, char* out) {
    return below->xGetLastError(below, n, out);
}
int vfsCurrentTimeInt64(sqlite3_vfs*, sqlite3_int64* out) {
    return below->xCurrentTimeInt64(below, out);
}

sqlite3_vfs counting{};

}  // namespace

bool countSqliteSyncs() {
    static std::once_flag once;
    static bool installed = false;
    std::call_once(once, [] {
        below = sqlite3_vfs_find(nullptr);
        if (!below || below->iVersion < 2) return;
        counting = sqlite3_vfs{
            .iVersion = 2,
            .szOsFile = static_cast<int>(sizeof(CountingFile)) + below->szOsFile,
            .mxPathname = below->mxPathname,
            .pNext = nullptr,
            .zName = "axbench-sync-counting",
            .pAppData = nullptr,
            .xOpen = vfsOpen,
            .xDelete = vfsDelete,
            .xAccess = vfsAccess,
            .xFullPathname = vfsFullPathname,
            .xDlOpen = vfsDlOpen,
            .xDlError = vfsDlError,
            .xDlSym = vfsDlSym,
            .xDlClose = vfsDlClose,
            .xRandomness = vfsRandomness,
            .xSleep = vfsSleep,
            .xCurrentTime = vfsCurrentTime,
            .xGetLastError = vfsGetLastError,
            .xCurrentTimeInt64 = vfsCurrentTimeInt64,
            .xSetSystemCall = nullptr,
            .xGetSystemCall = nullptr,
            .xNextSystemCall = nullptr,
        };
        installed = sqlite3_vfs_register(&counting, 1) == SQLITE_OK;
    });
    return installed;
}

SqliteSyncs sqliteSyncs() {
    return {databaseSyncs.load(), logSyncs.load(), otherSyncs.load()};
}

}  // namespace axbench
