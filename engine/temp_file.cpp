// The temporary-file layer (engine/temp_file.h): an SQLite VFS whose files
// without a name are made in the engine's temporary directory and nowhere
// else, with room reserved ahead of the pages written to them. Everything
// else (files opened by name, time, randomness, sleep) goes to the layer that
// was SQLite's default before this one.
#include "engine/temp_file.h"

#include <cstring>
#include <random>

#include "engine/page_cache.h"
#include "engine/private_sqlite3.h"
#include "engine/sqlite_btree.h"
#include "engine/temp_file_os.h"

namespace kov::engine {

namespace {

namespace os = tempfile;

// Names tried before giving up on a directory where every name is taken (a
// name is 16 random hexadecimal digits: a clash is somebody else's doing).
constexpr int kNameAttempts = 100;

// The prefix of every file this layer makes.
constexpr const char* kNamePrefix = "kovpager_";

std::string gLastError;

struct TempFile {
    sqlite3_file base;         // first: SQLite sees this
    os::Handle handle;
    std::int64_t reserved;     // bytes [0, reserved) have room held on the file system
};

TempFile* of(sqlite3_file* file) { return reinterpret_cast<TempFile*>(file); }

// Records the system's words for a failure and passes the code on.
int noted(int rc, std::string& error) {
    if (rc != SQLITE_OK)
        gLastError = std::move(error);
    return rc;
}

int fileClose(sqlite3_file* file) {
    os::close(of(file)->handle);
    of(file)->handle = os::kNoHandle;
    return SQLITE_OK;
}

int fileRead(sqlite3_file* file, void* buffer, int amount, sqlite3_int64 offset) {
    std::string error;
    int got = 0;
    int rc = os::readAt(of(file)->handle, buffer, amount, offset, &got, &error);
    if (rc != SQLITE_OK)
        return noted(rc, error);
    if (got < amount) {
        // Past the end: SQLite expects the rest zeroed, and the short-read code.
        std::memset(static_cast<char*>(buffer) + got, 0, static_cast<std::size_t>(amount - got));
        return SQLITE_IOERR_SHORT_READ;
    }
    return SQLITE_OK;
}

int fileWrite(sqlite3_file* file, const void* buffer, int amount, sqlite3_int64 offset) {
    std::string error;
    return noted(os::writeAt(of(file)->handle, buffer, amount, offset, &error), error);
}

int fileTruncate(sqlite3_file* file, sqlite3_int64 size) {
    std::string error;
    int rc = os::truncate(of(file)->handle, size, &error);
    if (rc == SQLITE_OK && size < of(file)->reserved)
        of(file)->reserved = size;  // the room past the new end went with it
    return noted(rc, error);
}

// Nothing is ever committed: there is nothing to make durable.
int fileSync(sqlite3_file*, int) { return SQLITE_OK; }

int fileSize(sqlite3_file* file, sqlite3_int64* size) {
    std::string error;
    std::int64_t bytes = 0;
    int rc = os::size(of(file)->handle, &bytes, &error);
    if (rc == SQLITE_OK)
        *size = bytes;
    return noted(rc, error);
}

// The file is the process's own and no one else opens it: no locks.
int fileLock(sqlite3_file*, int) { return SQLITE_OK; }
int fileCheckReservedLock(sqlite3_file*, int* out) {
    *out = 0;
    return SQLITE_OK;
}

int fileControl(sqlite3_file* file, int op, void* arg) {
    if (op == KOVSQ_FCNTL_RESERVE) {
        TempFile* f = of(file);
        const std::int64_t want = *static_cast<sqlite3_int64*>(arg);
        if (want <= f->reserved)
            return SQLITE_OK;
        std::string error;
        int rc = os::reserve(f->handle, f->reserved, want, &error);
        if (rc == SQLITE_OK)
            f->reserved = want;
        return noted(rc, error);
    }
    if (op == KOVSQ_FCNTL_RELEASE) {
        TempFile* f = of(file);
        const std::int64_t keep = *static_cast<sqlite3_int64*>(arg);
        if (keep >= f->reserved)
            return SQLITE_OK;
        std::string error;
        int rc = os::release(f->handle, keep, &error);
        if (rc == SQLITE_OK)
            f->reserved = keep;
        return noted(rc, error);
    }
    // The pager's own size hints are not needed: the engine reserves ahead of them.
    if (op == SQLITE_FCNTL_SIZE_HINT)
        return SQLITE_OK;
    return SQLITE_NOTFOUND;
}

int fileSectorSize(sqlite3_file*) { return 4096; }

int fileDeviceCharacteristics(sqlite3_file*) { return SQLITE_IOCAP_POWERSAFE_OVERWRITE; }

const sqlite3_io_methods kFileMethods = {
    1,  // iVersion: no shared memory, no memory mapping
    fileClose,
    fileRead,
    fileWrite,
    fileTruncate,
    fileSync,
    fileSize,
    fileLock,
    fileLock,  // xUnlock
    fileCheckReservedLock,
    fileControl,
    fileSectorSize,
    fileDeviceCharacteristics,
    nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
};

sqlite3_vfs gLayer{};
sqlite3_vfs* gPlatform = nullptr;  // the default layer before this one

std::string randomName() {
    static std::mt19937_64 generator{[] {
        std::random_device device;
        return (std::uint64_t{device()} << 32) ^ device();
    }()};
    static const char digits[] = "0123456789abcdef";
    std::uint64_t bits = generator();
    std::string name = kNamePrefix;
    for (int i = 0; i < 16; ++i, bits >>= 4)
        name += digits[bits & 15];
    return name;
}

// A file without a name: made in the temporary directory.
int openTemporary(sqlite3_file* file, int flags, int* outFlags) {
    TempFile* f = of(file);
    f->base.pMethods = nullptr;  // SQLite closes only what opened
    // An empty setting names the root (a chosen directory that was only separators).
    const char* setting = *kovsq_temp_directory();
    if (setting == nullptr) {
        gLastError = "cannot make a file: no temporary directory was chosen";
        return SQLITE_CANTOPEN;
    }
    const std::string directory = setting;
    std::string error;
    os::Handle handle = os::kNoHandle;
    int rc = SQLITE_CANTOPEN;
    for (int attempt = 0; attempt < kNameAttempts; ++attempt) {
        bool exists = false;
        rc = os::create(directory, randomName(), &handle, &exists, &error);
        if (rc == SQLITE_OK || !exists)
            break;
    }
    if (rc != SQLITE_OK)
        return noted(rc, error);
    f->handle = handle;
    f->reserved = 0;
    f->base.pMethods = &kFileMethods;
    if (outFlags != nullptr)
        *outFlags = flags;
    return SQLITE_OK;
}

int layerOpen(sqlite3_vfs*, sqlite3_filename name, sqlite3_file* file, int flags, int* outFlags) {
    if (name == nullptr)
        return openTemporary(file, flags, outFlags);
    return gPlatform->xOpen(gPlatform, name, file, flags, outFlags);
}

int layerDelete(sqlite3_vfs*, const char* name, int syncDir) {
    return gPlatform->xDelete(gPlatform, name, syncDir);
}
int layerAccess(sqlite3_vfs*, const char* name, int flags, int* out) {
    return gPlatform->xAccess(gPlatform, name, flags, out);
}
int layerFullPathname(sqlite3_vfs*, const char* name, int size, char* out) {
    return gPlatform->xFullPathname(gPlatform, name, size, out);
}
int layerRandomness(sqlite3_vfs*, int size, char* out) {
    return gPlatform->xRandomness(gPlatform, size, out);
}
int layerSleep(sqlite3_vfs*, int microseconds) { return gPlatform->xSleep(gPlatform, microseconds); }
int layerCurrentTime(sqlite3_vfs*, double* out) { return gPlatform->xCurrentTime(gPlatform, out); }
int layerGetLastError(sqlite3_vfs*, int size, char* out) {
    return gPlatform->xGetLastError(gPlatform, size, out);
}
int layerCurrentTimeInt64(sqlite3_vfs*, sqlite3_int64* out) {
    return gPlatform->xCurrentTimeInt64(gPlatform, out);
}

}  // namespace

bool installTemporaryFiles() {
    static bool installed = false;
    if (installed)
        return true;
    installPageCache();  // SQLite takes a page cache only before it initialises
    gPlatform = sqlite3_vfs_find(nullptr);
    if (gPlatform == nullptr || gPlatform->iVersion < 2)
        return false;
    gLayer.iVersion = 2;
    gLayer.szOsFile = gPlatform->szOsFile > static_cast<int>(sizeof(TempFile))
                          ? gPlatform->szOsFile
                          : static_cast<int>(sizeof(TempFile));
    gLayer.mxPathname = gPlatform->mxPathname;
    gLayer.zName = kTemporaryFileLayer;
    gLayer.xOpen = layerOpen;
    gLayer.xDelete = layerDelete;
    gLayer.xAccess = layerAccess;
    gLayer.xFullPathname = layerFullPathname;
    gLayer.xRandomness = layerRandomness;
    gLayer.xSleep = layerSleep;
    gLayer.xCurrentTime = layerCurrentTime;
    gLayer.xGetLastError = layerGetLastError;
    gLayer.xCurrentTimeInt64 = layerCurrentTimeInt64;
    installed = sqlite3_vfs_register(&gLayer, 1) == SQLITE_OK;
    return installed;
}

const std::string& lastTemporaryFileError() { return gLastError; }

void clearTemporaryFileError() {
    if (!gLastError.empty())
        gLastError.clear();
}

}  // namespace kov::engine
