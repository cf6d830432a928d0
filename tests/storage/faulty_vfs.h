#ifndef ORVANE_TESTS_STORAGE_FAULTY_VFS_H
#define ORVANE_TESTS_STORAGE_FAULTY_VFS_H

#include <sqlite3.h>

#include <atomic>
#include <cstdint>
#include <cstring>

// An SQLite file system that forwards to the platform's and can pretend that the disk is full
// (every write fails with SQLITE_FULL once a byte budget is spent) or that every file it opens
// is read-only. Installed as the default, so the code under test opens files as usual.
// Tests use it from their main thread only; the budget is atomic for safety all the same.
namespace FaultyVfs {

inline std::atomic<int64_t> g_writeBudget{-1};  // bytes still writable; -1 means unlimited
inline std::atomic<bool> g_readOnly{false};
inline sqlite3_vfs* g_real = nullptr;

struct File {
    sqlite3_file base;
    sqlite3_file* real;
};

inline sqlite3_file* Real(sqlite3_file* f) { return reinterpret_cast<File*>(f)->real; }

inline int Close(sqlite3_file* f) {
    int rc = Real(f)->pMethods != nullptr ? Real(f)->pMethods->xClose(Real(f)) : SQLITE_OK;
    return rc;
}
inline int Read(sqlite3_file* f, void* buf, int n, sqlite3_int64 off) {
    return Real(f)->pMethods->xRead(Real(f), buf, n, off);
}
inline int Write(sqlite3_file* f, const void* buf, int n, sqlite3_int64 off) {
    int64_t budget = g_writeBudget.load();
    if (budget >= 0) {
        if (budget < n) {
            g_writeBudget = 0;
            return SQLITE_FULL;
        }
        g_writeBudget = budget - n;
    }
    return Real(f)->pMethods->xWrite(Real(f), buf, n, off);
}
inline int Truncate(sqlite3_file* f, sqlite3_int64 size) { return Real(f)->pMethods->xTruncate(Real(f), size); }
inline int Sync(sqlite3_file* f, int flags) { return Real(f)->pMethods->xSync(Real(f), flags); }
inline int FileSize(sqlite3_file* f, sqlite3_int64* size) { return Real(f)->pMethods->xFileSize(Real(f), size); }
inline int Lock(sqlite3_file* f, int level) { return Real(f)->pMethods->xLock(Real(f), level); }
inline int Unlock(sqlite3_file* f, int level) { return Real(f)->pMethods->xUnlock(Real(f), level); }
inline int CheckReservedLock(sqlite3_file* f, int* out) {
    return Real(f)->pMethods->xCheckReservedLock(Real(f), out);
}
inline int FileControl(sqlite3_file* f, int op, void* arg) { return Real(f)->pMethods->xFileControl(Real(f), op, arg); }
inline int SectorSize(sqlite3_file* f) { return Real(f)->pMethods->xSectorSize(Real(f)); }
inline int DeviceCharacteristics(sqlite3_file* f) { return Real(f)->pMethods->xDeviceCharacteristics(Real(f)); }
inline int ShmMap(sqlite3_file* f, int pg, int sz, int extend, void volatile** out) {
    return Real(f)->pMethods->xShmMap(Real(f), pg, sz, extend, out);
}
inline int ShmLock(sqlite3_file* f, int offset, int n, int flags) {
    return Real(f)->pMethods->xShmLock(Real(f), offset, n, flags);
}
inline void ShmBarrier(sqlite3_file* f) { Real(f)->pMethods->xShmBarrier(Real(f)); }
inline int ShmUnmap(sqlite3_file* f, int deleteFlag) { return Real(f)->pMethods->xShmUnmap(Real(f), deleteFlag); }
inline int Fetch(sqlite3_file* f, sqlite3_int64 off, int n, void** out) {
    return Real(f)->pMethods->xFetch(Real(f), off, n, out);
}
inline int Unfetch(sqlite3_file* f, sqlite3_int64 off, void* p) { return Real(f)->pMethods->xUnfetch(Real(f), off, p); }

inline const sqlite3_io_methods IO_METHODS = {
    3,        Close,     Read,   Write,     Truncate, Sync,    FileSize, Lock,  Unlock, CheckReservedLock,
    FileControl, SectorSize, DeviceCharacteristics, ShmMap, ShmLock, ShmBarrier, ShmUnmap, Fetch, Unfetch,
};

inline int Open(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* f, int flags, int* outFlags) {
    auto* file = reinterpret_cast<File*>(f);
    file->base.pMethods = nullptr;
    file->real = reinterpret_cast<sqlite3_file*>(file + 1);
    if (g_readOnly && (flags & SQLITE_OPEN_MAIN_DB) != 0) {
        flags = (flags & ~(SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE)) | SQLITE_OPEN_READONLY;
    }
    int rc = g_real->xOpen(g_real, name, file->real, flags, outFlags);
    if (rc == SQLITE_OK) {
        file->base.pMethods = &IO_METHODS;
    }
    return rc;
}

inline int Delete(sqlite3_vfs*, const char* name, int syncDir) { return g_real->xDelete(g_real, name, syncDir); }
inline int Access(sqlite3_vfs*, const char* name, int flags, int* out) {
    return g_real->xAccess(g_real, name, flags, out);
}
inline int FullPathname(sqlite3_vfs*, const char* name, int n, char* out) {
    return g_real->xFullPathname(g_real, name, n, out);
}
inline void* DlOpen(sqlite3_vfs*, const char* name) { return g_real->xDlOpen(g_real, name); }
inline void DlError(sqlite3_vfs*, int n, char* msg) { g_real->xDlError(g_real, n, msg); }
inline void (*DlSym(sqlite3_vfs*, void* handle, const char* sym))(void) { return g_real->xDlSym(g_real, handle, sym); }
inline void DlClose(sqlite3_vfs*, void* handle) { g_real->xDlClose(g_real, handle); }
inline int Randomness(sqlite3_vfs*, int n, char* out) { return g_real->xRandomness(g_real, n, out); }
inline int Sleep(sqlite3_vfs*, int us) { return g_real->xSleep(g_real, us); }
inline int CurrentTime(sqlite3_vfs*, double* out) { return g_real->xCurrentTime(g_real, out); }
inline int GetLastError(sqlite3_vfs*, int n, char* out) { return g_real->xGetLastError(g_real, n, out); }
inline int CurrentTimeInt64(sqlite3_vfs*, sqlite3_int64* out) { return g_real->xCurrentTimeInt64(g_real, out); }

// Makes the faulty file system the default one; idempotent.
inline void Install() {
    static sqlite3_vfs vfs;
    if (g_real != nullptr) {
        return;
    }
    sqlite3_initialize();
    g_real = sqlite3_vfs_find(nullptr);
    std::memset(&vfs, 0, sizeof(vfs));
    vfs.iVersion = 2;
    vfs.szOsFile = static_cast<int>(sizeof(File)) + g_real->szOsFile;
    vfs.mxPathname = g_real->mxPathname;
    vfs.zName = "faulty";
    vfs.xOpen = Open;
    vfs.xDelete = Delete;
    vfs.xAccess = Access;
    vfs.xFullPathname = FullPathname;
    vfs.xDlOpen = DlOpen;
    vfs.xDlError = DlError;
    vfs.xDlSym = DlSym;
    vfs.xDlClose = DlClose;
    vfs.xRandomness = Randomness;
    vfs.xSleep = Sleep;
    vfs.xCurrentTime = CurrentTime;
    vfs.xGetLastError = GetLastError;
    vfs.xCurrentTimeInt64 = CurrentTimeInt64;
    sqlite3_vfs_register(&vfs, 1);
}

// Restores a healthy disk.
inline void Heal() {
    g_writeBudget = -1;
    g_readOnly = false;
}

}  // namespace FaultyVfs

#endif  // ORVANE_TESTS_STORAGE_FAULTY_VFS_H
