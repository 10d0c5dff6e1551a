// A test-only SQLite VFS that wraps the default one and injects failures.
//
// FaultVfs forwards every call to the VFS that was the default when it was
// made (sqlite3_vfs_find(nullptr), after the engine's temporary-file layer
// was installed: so that layer, engine/temp_file.h) and counts the file calls
// by kind. It can
// make one kind of call fail:
//
//   kind      counted calls                         injected result
//   Read      xRead                                 SQLITE_IOERR_READ
//   Write     xWrite                                SQLITE_IOERR_WRITE
//   Truncate  xTruncate                             SQLITE_IOERR_TRUNCATE
//   Sync      xSync                                 SQLITE_IOERR_FSYNC
//   Open      xOpen (every file)                    SQLITE_CANTOPEN
//   TempOpen  xOpen of a temporary file: no name,   SQLITE_CANTOPEN
//             SQLITE_OPEN_DELETEONCLOSE, or a
//             temporary database
//   Reserve   a reservation of room in a file       SQLITE_FULL
//             (the file control KOVSQ_FCNTL_RESERVE)
//
// failAt(kind, n, mode) arms a fault: the n-th call of that kind counted
// from the moment it is armed (1 = the very next one) fails, and with
// FaultMode::Persistent every later call of that kind fails too, until
// clear(). A failed call is not forwarded: the file is left untouched. An
// open of a temporary file counts both as Open and as TempOpen, and fails
// when either is due.
//
// Full disk: setSpaceBudget(bytes) caps the bytes held by the files opened
// through this VFS (a file holds the larger of the end of its furthest write
// and the room reserved in it, lowered by truncation; a delete-on-close file
// gives its bytes back when closed). A write or a reservation that would take
// the total past the budget fails with SQLITE_FULL and changes nothing; a
// write inside what a file holds always goes through, as on a real disk
// after a reservation. Raising the budget (or clearSpaceBudget()) models
// space coming back.
//
// Counters: calls(kind) counts every call of the kind, failed ones included;
// injected(kind) counts the failures this VFS made; fullRefusals() counts
// the SQLITE_FULL answers. resetCounters() zeroes them (armed faults keep
// their place relative to the calls still to come).
//
// ScopedFaultVfs registers a FaultVfs as the default VFS (so a connection
// opened afterwards, and its temporary files, go through it) and, on
// destruction, unregisters it and makes the previous default the default
// again. Connections using it must be closed first.
//
// Threads: one connection on one thread at a time; nothing here locks.
#ifndef KOVPAGER_TESTS_FAULT_VFS_H
#define KOVPAGER_TESTS_FAULT_VFS_H

#include "engine/private_sqlite3.h"

#include <cstdint>

namespace kov::test {

enum class FaultKind : int { Read = 0, Write, Truncate, Sync, Open, TempOpen, Reserve };
constexpr int kFaultKinds = 7;

enum class FaultMode { Once, Persistent };

class FaultVfs {
  public:
    // Wraps the current default VFS under the name "kov-fault".
    FaultVfs();
    FaultVfs(const FaultVfs&) = delete;
    FaultVfs& operator=(const FaultVfs&) = delete;

    // The VFS object to register.
    sqlite3_vfs* vfs() { return &vfs_; }
    // The wrapped VFS.
    sqlite3_vfs* wrapped() const { return real_; }

    void failAt(FaultKind kind, std::uint64_t n, FaultMode mode);
    void clear(FaultKind kind);
    void clearAll();

    void setSpaceBudget(std::uint64_t bytes);
    void clearSpaceBudget();

    std::uint64_t calls(FaultKind kind) const { return state_[index(kind)].calls; }
    std::uint64_t injected(FaultKind kind) const { return state_[index(kind)].injected; }
    std::uint64_t fullRefusals() const { return fullRefusals_; }
    // Bytes currently held by the files opened through this VFS.
    std::uint64_t bytesInUse() const { return bytesInUse_; }
    // Bytes passed to successful writes since the last resetCounters().
    std::uint64_t bytesWritten() const { return bytesWritten_; }
    void resetCounters();

    // Internal: used by the VFS and file callbacks.
    struct Hooks;

  private:
    struct KindState {
        std::uint64_t calls = 0;
        std::uint64_t injected = 0;
        std::uint64_t trigger = 0;  // the call number that fails first; 0 = none armed
        bool persistent = false;
    };

    static int index(FaultKind kind) { return static_cast<int>(kind); }

    // Counts one call of `kind`; true when it must fail.
    bool take(FaultKind kind);
    // True (and counted) when `growth` more bytes would pass the space budget.
    bool refusesGrowth(std::uint64_t growth);

    sqlite3_vfs vfs_{};
    sqlite3_vfs* real_ = nullptr;
    KindState state_[kFaultKinds];
    bool budgetSet_ = false;
    std::uint64_t budget_ = 0;
    std::uint64_t bytesInUse_ = 0;
    std::uint64_t bytesWritten_ = 0;
    std::uint64_t fullRefusals_ = 0;
};

// Registers a FaultVfs as the default VFS for its lifetime.
class ScopedFaultVfs {
  public:
    ScopedFaultVfs();
    ~ScopedFaultVfs();
    ScopedFaultVfs(const ScopedFaultVfs&) = delete;
    ScopedFaultVfs& operator=(const ScopedFaultVfs&) = delete;

    FaultVfs& faults() { return faults_; }
    // The result of sqlite3_vfs_register.
    int registerRc() const { return registerRc_; }

  private:
    FaultVfs faults_;
    sqlite3_vfs* previous_ = nullptr;
    int registerRc_ = SQLITE_ERROR;
};

}  // namespace kov::test

#endif  // KOVPAGER_TESTS_FAULT_VFS_H
