// The fault-injecting VFS: a thin layer of callbacks that count, decide and
// forward to the wrapped VFS.
//
// A file opened through it is a FaultFile followed, at an 8-byte aligned
// offset, by the wrapped VFS's own file object. The FaultFile's methods are
// version 1 (no shared memory, no memory mapping), so every page read and
// write of the database goes through xRead and xWrite and is counted.
#include "fault_vfs.h"

#include <algorithm>
#include <cstddef>
#include <cstring>

#include "engine/sqlite_btree.h"
#include "engine/temp_file.h"

namespace kov::test {

namespace {

struct FaultFile {
    sqlite3_file base;
    FaultVfs* owner;
    std::uint64_t size;      // the end of the furthest write, for the space budget
    std::uint64_t reserved;  // bytes from the start that a reservation holds room for
    bool deleteOnClose;

    // The bytes the file takes on the modelled disk.
    std::uint64_t held() const { return std::max(size, reserved); }
};

constexpr std::size_t kRealOffset = (sizeof(FaultFile) + 7) / 8 * 8;

sqlite3_file* realFile(sqlite3_file* f) {
    return reinterpret_cast<sqlite3_file*>(reinterpret_cast<unsigned char*>(f) + kRealOffset);
}

FaultFile* faultFile(sqlite3_file* f) {
    return reinterpret_cast<FaultFile*>(f);
}

bool isTemporaryOpen(const char* name, int flags) {
    return name == nullptr || (flags & (SQLITE_OPEN_DELETEONCLOSE | SQLITE_OPEN_TEMP_DB |
                                        SQLITE_OPEN_TEMP_JOURNAL | SQLITE_OPEN_TRANSIENT_DB)) != 0;
}

}  // namespace

struct FaultVfs::Hooks {
    static FaultVfs* of(sqlite3_vfs* v) { return static_cast<FaultVfs*>(v->pAppData); }

    // A method that only passes the call on to the wrapped file (Method: the member of
    // sqlite3_io_methods) or to the wrapped VFS (a member of sqlite3_vfs), unchanged.
    template <auto Method, typename... Args>
    static auto passToFile(sqlite3_file* f, Args... args) {
        sqlite3_file* real = realFile(f);
        return (real->pMethods->*Method)(real, args...);
    }
    template <auto Method, typename... Args>
    static auto passToVfs(sqlite3_vfs* v, Args... args) {
        sqlite3_vfs* real = of(v)->real_;
        return (real->*Method)(real, args...);
    }

    // File methods.
    static int close(sqlite3_file* f) {
        FaultFile* ff = faultFile(f);
        sqlite3_file* real = realFile(f);
        int rc = real->pMethods != nullptr ? real->pMethods->xClose(real) : SQLITE_OK;
        if (ff->deleteOnClose)
            ff->owner->bytesInUse_ -= ff->held();
        ff->size = 0;
        ff->reserved = 0;
        return rc;
    }
    static int read(sqlite3_file* f, void* buf, int amt, sqlite3_int64 offset) {
        FaultFile* ff = faultFile(f);
        if (ff->owner->take(FaultKind::Read))
            return SQLITE_IOERR_READ;
        sqlite3_file* real = realFile(f);
        return real->pMethods->xRead(real, buf, amt, offset);
    }
    static int write(sqlite3_file* f, const void* buf, int amt, sqlite3_int64 offset) {
        FaultFile* ff = faultFile(f);
        FaultVfs* owner = ff->owner;
        if (owner->take(FaultKind::Write))
            return SQLITE_IOERR_WRITE;
        std::uint64_t end = static_cast<std::uint64_t>(offset) + static_cast<std::uint64_t>(amt);
        std::uint64_t growth = end > ff->held() ? end - ff->held() : 0;
        if (owner->refusesGrowth(growth))
            return SQLITE_FULL;
        sqlite3_file* real = realFile(f);
        int rc = real->pMethods->xWrite(real, buf, amt, offset);
        if (rc == SQLITE_OK) {
            ff->size = std::max(ff->size, end);
            owner->bytesInUse_ += growth;
            owner->bytesWritten_ += static_cast<std::uint64_t>(amt);
        }
        return rc;
    }
    static int truncate(sqlite3_file* f, sqlite3_int64 size) {
        FaultFile* ff = faultFile(f);
        if (ff->owner->take(FaultKind::Truncate))
            return SQLITE_IOERR_TRUNCATE;
        sqlite3_file* real = realFile(f);
        int rc = real->pMethods->xTruncate(real, size);
        std::uint64_t newSize = static_cast<std::uint64_t>(size);
        if (rc == SQLITE_OK && newSize < ff->held()) {
            ff->owner->bytesInUse_ -= ff->held() - newSize;
            ff->size = std::min(ff->size, newSize);
            ff->reserved = std::min(ff->reserved, newSize);
        }
        return rc;
    }
    // A reservation (KOVSQ_FCNTL_RESERVE) takes its growth from the space budget like a write, and
    // a release (KOVSQ_FCNTL_RELEASE) gives it back; other file controls pass.
    static int fileControl(sqlite3_file* f, int op, void* arg) {
        FaultFile* ff = faultFile(f);
        sqlite3_file* real = realFile(f);
        if (op == KOVSQ_FCNTL_RELEASE) {
            // Room given back: the file holds less.
            int rc = real->pMethods->xFileControl(real, op, arg);
            const auto keep = static_cast<std::uint64_t>(*static_cast<sqlite3_int64*>(arg));
            if (rc == SQLITE_OK && keep < ff->reserved) {
                const std::uint64_t before = ff->held();
                ff->reserved = std::max(keep, ff->size);
                ff->owner->bytesInUse_ -= before - ff->held();
            }
            return rc;
        }
        if (op != KOVSQ_FCNTL_RESERVE)
            return real->pMethods->xFileControl(real, op, arg);
        FaultVfs* owner = ff->owner;
        if (owner->take(FaultKind::Reserve))
            return SQLITE_FULL;
        const auto want = static_cast<std::uint64_t>(*static_cast<sqlite3_int64*>(arg));
        const std::uint64_t growth = want > ff->held() ? want - ff->held() : 0;
        if (owner->refusesGrowth(growth))
            return SQLITE_FULL;
        int rc = real->pMethods->xFileControl(real, op, arg);
        if (rc == SQLITE_OK) {
            ff->reserved = std::max(ff->reserved, want);
            owner->bytesInUse_ += growth;
        }
        return rc;
    }
    static int sync(sqlite3_file* f, int flags) {
        FaultFile* ff = faultFile(f);
        if (ff->owner->take(FaultKind::Sync))
            return SQLITE_IOERR_FSYNC;
        sqlite3_file* real = realFile(f);
        return real->pMethods->xSync(real, flags);
    }

    static const sqlite3_io_methods methods;

    // VFS methods.
    static int open(sqlite3_vfs* v, const char* name, sqlite3_file* f, int flags, int* outFlags) {
        FaultVfs* self = of(v);
        FaultFile* ff = faultFile(f);
        std::memset(ff, 0, sizeof(FaultFile));
        bool temporary = isTemporaryOpen(name, flags);
        bool fail = self->take(FaultKind::Open);
        if (temporary && self->take(FaultKind::TempOpen))
            fail = true;
        if (fail)
            return SQLITE_CANTOPEN;

        sqlite3_file* real = realFile(f);
        std::memset(real, 0, static_cast<std::size_t>(self->real_->szOsFile));
        int rc = self->real_->xOpen(self->real_, name, real, flags, outFlags);
        // The wrapped file must be closed whenever it set its methods, even
        // after a failed open, so the wrapper takes the file over then too.
        if (real->pMethods != nullptr) {
            ff->base.pMethods = &methods;
            ff->owner = self;
            ff->deleteOnClose = (flags & SQLITE_OPEN_DELETEONCLOSE) != 0 || name == nullptr;
            sqlite3_int64 size = 0;
            if (rc == SQLITE_OK && real->pMethods->xFileSize(real, &size) == SQLITE_OK &&
                size > 0) {
                ff->size = static_cast<std::uint64_t>(size);
                if (ff->deleteOnClose)
                    self->bytesInUse_ += ff->size;
            }
            // Bytes of a file that outlives its close are not tracked.
            if (!ff->deleteOnClose)
                ff->size = 0;
        }
        return rc;
    }
    static int getLastError(sqlite3_vfs* v, int n, char* zOut) {
        sqlite3_vfs* real = of(v)->real_;
        return real->xGetLastError != nullptr ? real->xGetLastError(real, n, zOut) : 0;
    }
    static int currentTimeInt64(sqlite3_vfs* v, sqlite3_int64* pOut) {
        sqlite3_vfs* real = of(v)->real_;
        if (real->iVersion >= 2 && real->xCurrentTimeInt64 != nullptr)
            return real->xCurrentTimeInt64(real, pOut);
        double now = 0;
        int rc = real->xCurrentTime(real, &now);
        *pOut = static_cast<sqlite3_int64>(now * 86400000.0);
        return rc;
    }
};

const sqlite3_io_methods FaultVfs::Hooks::methods = {
    1,
    &FaultVfs::Hooks::close,
    &FaultVfs::Hooks::read,
    &FaultVfs::Hooks::write,
    &FaultVfs::Hooks::truncate,
    &FaultVfs::Hooks::sync,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xFileSize, sqlite3_int64*>,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xLock, int>,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xUnlock, int>,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xCheckReservedLock, int*>,
    &FaultVfs::Hooks::fileControl,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xSectorSize>,
    &FaultVfs::Hooks::passToFile<&sqlite3_io_methods::xDeviceCharacteristics>,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
    nullptr,
};

FaultVfs::FaultVfs() : real_((kov::engine::installTemporaryFiles(), sqlite3_vfs_find(nullptr))) {
    vfs_.iVersion = 2;
    vfs_.szOsFile = static_cast<int>(kRealOffset) + (real_ != nullptr ? real_->szOsFile : 0);
    vfs_.mxPathname = real_ != nullptr ? real_->mxPathname : 512;
    vfs_.zName = "kov-fault";
    vfs_.pAppData = this;
    vfs_.xOpen = &Hooks::open;
    vfs_.xDelete = &Hooks::passToVfs<&sqlite3_vfs::xDelete, const char*, int>;
    vfs_.xAccess = &Hooks::passToVfs<&sqlite3_vfs::xAccess, const char*, int, int*>;
    vfs_.xFullPathname =
        &Hooks::passToVfs<&sqlite3_vfs::xFullPathname, const char*, int, char*>;
    vfs_.xDlOpen = &Hooks::passToVfs<&sqlite3_vfs::xDlOpen, const char*>;
    vfs_.xDlError = &Hooks::passToVfs<&sqlite3_vfs::xDlError, int, char*>;
    vfs_.xDlSym = &Hooks::passToVfs<&sqlite3_vfs::xDlSym, void*, const char*>;
    vfs_.xDlClose = &Hooks::passToVfs<&sqlite3_vfs::xDlClose, void*>;
    vfs_.xRandomness = &Hooks::passToVfs<&sqlite3_vfs::xRandomness, int, char*>;
    vfs_.xSleep = &Hooks::passToVfs<&sqlite3_vfs::xSleep, int>;
    vfs_.xCurrentTime = &Hooks::passToVfs<&sqlite3_vfs::xCurrentTime, double*>;
    vfs_.xGetLastError = &Hooks::getLastError;
    vfs_.xCurrentTimeInt64 = &Hooks::currentTimeInt64;
}

bool FaultVfs::refusesGrowth(std::uint64_t growth) {
    if (!budgetSet_ || growth == 0 || bytesInUse_ + growth <= budget_)
        return false;
    ++fullRefusals_;
    return true;
}

bool FaultVfs::take(FaultKind kind) {
    KindState& s = state_[index(kind)];
    ++s.calls;
    bool fail = s.trigger != 0 && (s.calls == s.trigger || (s.persistent && s.calls > s.trigger));
    if (fail)
        ++s.injected;
    return fail;
}

void FaultVfs::failAt(FaultKind kind, std::uint64_t n, FaultMode mode) {
    KindState& s = state_[index(kind)];
    if (n == 0)
        n = 1;
    s.trigger = s.calls + n;
    s.persistent = mode == FaultMode::Persistent;
}

void FaultVfs::clear(FaultKind kind) {
    KindState& s = state_[index(kind)];
    s.trigger = 0;
    s.persistent = false;
}

void FaultVfs::clearAll() {
    for (int k = 0; k < kFaultKinds; ++k)
        clear(static_cast<FaultKind>(k));
}

void FaultVfs::setSpaceBudget(std::uint64_t bytes) {
    budgetSet_ = true;
    budget_ = bytes;
}

void FaultVfs::clearSpaceBudget() {
    budgetSet_ = false;
}

void FaultVfs::resetCounters() {
    for (KindState& s : state_) {
        // An armed fault keeps its distance from the calls still to come.
        if (s.trigger > s.calls) {
            s.trigger -= s.calls;
        } else if (s.trigger != 0) {
            // Already reached: a persistent fault goes on failing, a single one is spent.
            s.trigger = s.persistent ? 1 : 0;
        }
        s.calls = 0;
        s.injected = 0;
    }
    fullRefusals_ = 0;
    bytesWritten_ = 0;
}

ScopedFaultVfs::ScopedFaultVfs() : previous_(sqlite3_vfs_find(nullptr)) {
    sqlite3_initialize();
    if (faults_.wrapped() != nullptr)
        registerRc_ = sqlite3_vfs_register(faults_.vfs(), 1);
}

ScopedFaultVfs::~ScopedFaultVfs() {
    if (registerRc_ != SQLITE_OK)
        return;
    sqlite3_vfs_unregister(faults_.vfs());
    if (previous_ != nullptr)
        sqlite3_vfs_register(previous_, 1);
}

}  // namespace kov::test
