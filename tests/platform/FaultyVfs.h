#pragma once

// A SQLite VFS over the default one whose files fail on demand: writes with an I/O error, or syncs, the two ways a
// disk lets a database down. Registered once per process under kName; open a store through it by that name. The
// fault is one process-wide setting, for tests that run one store at a time.

#include <sqlite3.h>

#include <atomic>
#include <cstring>

namespace bexil::test {

class FaultyVfs {
  public:
    static constexpr const char* kName = "bexil-test-faulty";
    enum class Fault { None, Writes, Syncs };

    // Registers the VFS (once) and sets the fault that every file opened through it shows from now on.
    static void set(Fault fault) {
        install();
        fault_.store(fault);
    }

  private:
    struct File {
        sqlite3_file base;
        sqlite3_file* inner;  // the default VFS's file, stored right after this struct
    };
    static sqlite3_file* inner(sqlite3_file* file) { return reinterpret_cast<File*>(file)->inner; }
    static const sqlite3_io_methods* real(sqlite3_file* file) { return inner(file)->pMethods; }

    static void install() {
        static const bool installed = [] {
            sqlite3_vfs* real = sqlite3_vfs_find(nullptr);
            static sqlite3_vfs vfs = *real;
            vfs.zName = kName;
            vfs.szOsFile = static_cast<int>(sizeof(File)) + real->szOsFile;
            vfs.pAppData = real;
            vfs.xOpen = open;
            return sqlite3_vfs_register(&vfs, 0) == SQLITE_OK;
        }();
        (void)installed;
    }

    static int open(sqlite3_vfs* vfs, const char* name, sqlite3_file* file, int flags, int* outFlags) {
        auto* real = static_cast<sqlite3_vfs*>(vfs->pAppData);
        File* wrapper = reinterpret_cast<File*>(file);
        std::memset(wrapper, 0, sizeof(File));
        wrapper->inner = reinterpret_cast<sqlite3_file*>(wrapper + 1);
        int rc = real->xOpen(real, name, wrapper->inner, flags, outFlags);
        if (wrapper->inner->pMethods == nullptr) return rc;  // nothing to close: leave pMethods null too
        static const sqlite3_io_methods methods = wrapped();
        wrapper->base.pMethods = &methods;
        return rc;
    }

    // Every method forwards to the real file through that file's own methods (the default VFS gives the database,
    // its log and its journals different ones); writes and syncs fail while their fault is set.
    static sqlite3_io_methods wrapped() {
        sqlite3_io_methods m{};
        m.iVersion = 3;
        m.xClose = [](sqlite3_file* f) { return real(f)->xClose(inner(f)); };
        m.xRead = [](sqlite3_file* f, void* b, int n, sqlite3_int64 o) { return real(f)->xRead(inner(f), b, n, o); };
        m.xWrite = [](sqlite3_file* f, const void* b, int n, sqlite3_int64 o) {
            return fault_.load() == Fault::Writes ? SQLITE_IOERR_WRITE : real(f)->xWrite(inner(f), b, n, o);
        };
        m.xTruncate = [](sqlite3_file* f, sqlite3_int64 size) { return real(f)->xTruncate(inner(f), size); };
        m.xSync = [](sqlite3_file* f, int flags) {
            return fault_.load() == Fault::Syncs ? SQLITE_IOERR_FSYNC : real(f)->xSync(inner(f), flags);
        };
        m.xFileSize = [](sqlite3_file* f, sqlite3_int64* size) { return real(f)->xFileSize(inner(f), size); };
        m.xLock = [](sqlite3_file* f, int lock) { return real(f)->xLock(inner(f), lock); };
        m.xUnlock = [](sqlite3_file* f, int lock) { return real(f)->xUnlock(inner(f), lock); };
        m.xCheckReservedLock = [](sqlite3_file* f, int* out) { return real(f)->xCheckReservedLock(inner(f), out); };
        m.xFileControl = [](sqlite3_file* f, int op, void* arg) { return real(f)->xFileControl(inner(f), op, arg); };
        m.xSectorSize = [](sqlite3_file* f) { return real(f)->xSectorSize(inner(f)); };
        m.xDeviceCharacteristics = [](sqlite3_file* f) { return real(f)->xDeviceCharacteristics(inner(f)); };
        m.xShmMap = [](sqlite3_file* f, int page, int size, int extend, void volatile** out) {
            return real(f)->xShmMap(inner(f), page, size, extend, out);
        };
        m.xShmLock = [](sqlite3_file* f, int offset, int n, int flags) {
            return real(f)->xShmLock(inner(f), offset, n, flags);
        };
        m.xShmBarrier = [](sqlite3_file* f) { real(f)->xShmBarrier(inner(f)); };
        m.xShmUnmap = [](sqlite3_file* f, int deleteFlag) { return real(f)->xShmUnmap(inner(f), deleteFlag); };
        m.xFetch = [](sqlite3_file* f, sqlite3_int64 offset, int amount, void** out) {
            return real(f)->xFetch(inner(f), offset, amount, out);
        };
        m.xUnfetch = [](sqlite3_file* f, sqlite3_int64 offset, void* page) {
            return real(f)->xUnfetch(inner(f), offset, page);
        };
        return m;
    }

    static inline std::atomic<Fault> fault_{Fault::None};
};

}  // namespace bexil::test
