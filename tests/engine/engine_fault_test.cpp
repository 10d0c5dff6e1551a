// The engine binding under injected I/O failures and a full disk.
//
// The engine is driven the way the store drives it (flags 3, the store's
// page size, an exclusive write transaction that is never committed, three
// tables of the store's three kinds, one writing cursor per table) with a
// cache of 100 pages, so that a few MB of records already spill to the
// temporary file. Each test arms one kind of fault at many points of a run
// (the n-th call of that kind, n stepping through all the calls a clean run
// makes) and then records exactly what the binding reports and what is left:
// which entries read back, whether the write transaction is still open,
// whether writing works again once the fault is gone (it does not: the first
// failure ends the write transaction, and the binding then refuses every
// insert, table creation and drop with SQLITE_ERROR until the engine is
// closed; a fresh engine works). docs/faults.md sums the results up.
//
// Every walk is bounded (a table never yields more entries than were
// inserted, plus a margin), so a broken table shows as a failed assertion,
// never as a hang.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <set>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine/temp_file.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"
#include "fault_vfs.h"
#include "kov_test_access.h"

namespace {

using namespace kov::engine;  // NOLINT(google-build-using-namespace)
using kov::test::FaultKind;
using kov::test::FaultMode;
using kov::test::FaultVfs;
using kov::test::ScopedFaultVfs;

constexpr int kRecords = 4000;  // x 3 tables, about 2.5 MB through the file
constexpr int kCachePages = 100;
constexpr std::size_t kDataSize = 300;
constexpr int kTables = 3;
constexpr int kTableFlags[kTables] = {0, BTREE_INTKEY | BTREE_LEAFDATA, BTREE_ZERODATA};
constexpr int kIntTable = 1;
constexpr int kKeyOnlyTable = 2;
constexpr int kSteps = 8;  // fault points per kind and mode

std::string keyOf(int i) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "key%08d", i);
    return buf;
}

std::string dataOf(int i) {
    std::string d(kDataSize, '\0');
    for (std::size_t j = 0; j < kDataSize; ++j)
        d[j] = static_cast<char>((static_cast<std::size_t>(i) * 31 + j * 7) & 0xff);
    return d;
}

// The record inserted at step j: in order, or a fixed permutation of
// 0..kRecords-1 that makes the inserts land all over the tables (and so read
// evicted pages back).
int recordAt(int j, bool shuffled) {
    if (!shuffled)
        return j;
    return static_cast<int>((static_cast<std::uint64_t>(j) * 2654435761ull) % kRecords);
}

// What a walk over one table found.
struct Walk {
    int rc = SQLITE_OK;        // the first failing call's result
    std::vector<int> records;  // records read back, in key order
    bool intact = true;        // every key and data matched its record
    bool bounded = true;       // the walk ended by itself
};

// One engine opened and used the way the store uses it, with the model of
// what each table should hold (the records whose insert reported success).
//
// Inserts go straight into the B-trees here, each insert meeting the faults
// itself; the gathered path has its own tests (engine_load_fault_test.cpp).
class Store {
  public:
    Store() {
        openRc = sqlite3BtreeOpen(nullptr, nullptr, &bt, BTREE_OMIT_JOURNAL | BTREE_NO_READLOCK);
        if (bt == nullptr)
            return;
        sqlite3BtreeSetPageSize(bt, static_cast<int>(KovTestAccess::defaultPageSize()), -1);
        sqlite3BtreeSetCacheSize(bt, kCachePages);
        beginRc = sqlite3BtreeBeginTrans(bt, 2);
        for (int t = 0; t < kTables && createRc == SQLITE_OK; ++t)
            createRc = sqlite3BtreeCreateTable(bt, &root[t], kTableFlags[t]);
        for (int t = 0; t < kTables && createRc == SQLITE_OK; ++t)
            createRc = sqlite3BtreeCursor(bt, root[t], 1, nullptr, nullptr, &cursor[t]);
    }
    ~Store() { close(); }
    Store(const Store&) = delete;
    Store& operator=(const Store&) = delete;

    kov::engine::test::ScopedLoadLimits straight{kov::engine::test::kStraightLoads};

    bool ready() const {
        return bt != nullptr && openRc == SQLITE_OK && beginRc == SQLITE_OK &&
               createRc == SQLITE_OK;
    }

    int insert(int t, int i) {
        std::string key = keyOf(i);
        std::string data = dataOf(i);
        int rc;
        if (t == kIntTable) {
            rc =
                sqlite3BtreeInsert(cursor[t], nullptr, i, data.data(), static_cast<int>(kDataSize));
        } else if (t == kKeyOnlyTable) {
            rc = sqlite3BtreeInsert(cursor[t], key.data(), static_cast<std::int64_t>(key.size()),
                                    nullptr, 0);
        } else {
            rc = sqlite3BtreeInsert(cursor[t], key.data(), static_cast<std::int64_t>(key.size()),
                                    data.data(), static_cast<int>(kDataSize));
        }
        if (rc == SQLITE_OK)
            model[t].insert(i);
        return rc;
    }

    // Inserts every record into every table (record by record, table by
    // table). Returns the number of failed inserts; the first failure's
    // result and position (step * kTables + table) are kept.
    int insertAll(bool shuffled) {
        int failures = 0;
        for (int j = 0; j < kRecords; ++j) {
            for (int t = 0; t < kTables; ++t) {
                int rc = insert(t, recordAt(j, shuffled));
                if (rc != SQLITE_OK) {
                    if (failures == 0) {
                        firstFailureRc = rc;
                        firstFailureAt = j * kTables + t;
                    } else if (rc == SQLITE_ERROR) {
                        ++refusedAfterFirst;
                    }
                    ++failures;
                }
            }
        }
        return failures;
    }

    Walk walk(int t) {
        Walk w;
        BtCursor* c = cursor[t];
        int res = 1;
        w.rc = sqlite3BtreeFirst(c, &res);
        if (w.rc != SQLITE_OK || res != 0)
            return w;
        for (int n = 0; n < kRecords + 10; ++n) {
            readEntry(t, w);
            w.rc = sqlite3BtreeNext(c, &res);
            if (w.rc != SQLITE_OK || res != 0)
                return w;
        }
        w.bounded = false;
        return w;
    }

    // True when table t reads back exactly its model.
    bool holdsModel(int t) {
        Walk w = walk(t);
        std::vector<int> expected(model[t].begin(), model[t].end());
        return w.rc == SQLITE_OK && w.bounded && w.intact && w.records == expected;
    }

    // True while the engine accepts writes (no failure has ended its write transaction).
    bool writable() const { return sqlite3BtreeTxnState(bt) == SQLITE_TXN_WRITE; }

    // Table creation and drop need every cursor closed; these close and reopen them.
    void closeCursors() {
        for (BtCursor*& c : cursor) {
            if (c != nullptr)
                sqlite3BtreeCloseCursor(c);
            c = nullptr;
        }
    }
    int reopenCursors() {
        int rc = SQLITE_OK;
        for (int t = 0; t < kTables && rc == SQLITE_OK; ++t)
            rc = sqlite3BtreeCursor(bt, root[t], 1, nullptr, nullptr, &cursor[t]);
        return rc;
    }

    int close() {
        int rc = SQLITE_OK;
        for (BtCursor*& c : cursor) {
            if (c != nullptr)
                sqlite3BtreeCloseCursor(c);
            c = nullptr;
        }
        if (bt != nullptr)
            rc = sqlite3BtreeClose(bt);
        bt = nullptr;
        return rc;
    }

    Btree* bt = nullptr;
    std::uint32_t root[kTables] = {};
    BtCursor* cursor[kTables] = {};
    std::set<int> model[kTables];
    int openRc = -1;
    int beginRc = -1;
    int createRc = SQLITE_OK;
    int firstFailureRc = SQLITE_OK;
    int firstFailureAt = -1;
    int refusedAfterFirst = 0;  // later failures that were SQLITE_ERROR refusals

  private:
    void readEntry(int t, Walk& w) {
        BtCursor* c = cursor[t];
        std::int64_t keySize = 0;
        std::uint32_t dataSize = 0;
        sqlite3BtreeKeySize(c, &keySize);
        sqlite3BtreeDataSize(c, &dataSize);
        int i = -1;
        if (t == kIntTable) {
            i = static_cast<int>(keySize);
        } else {
            std::string key(static_cast<std::size_t>(keySize), '\0');
            if (keySize > 0 && keySize < 64 &&
                sqlite3BtreeKey(c, 0, static_cast<std::uint32_t>(keySize), key.data()) ==
                    SQLITE_OK &&
                key.compare(0, 3, "key") == 0) {
                i = std::atoi(key.c_str() + 3);
                if (key != keyOf(i))
                    w.intact = false;
            } else {
                w.intact = false;
            }
        }
        if (t != kKeyOnlyTable) {
            std::string data(dataSize, '\0');
            if (dataSize != kDataSize ||
                sqlite3BtreeData(c, 0, dataSize, data.data()) != SQLITE_OK || data != dataOf(i))
                w.intact = false;
        }
        w.records.push_back(i);
    }
};

// The calls of each kind that a clean run makes: inserts, one walk over
// every table, close.
struct CleanRun {
    std::uint64_t insertCalls[kov::test::kFaultKinds] = {};
    std::uint64_t totalCalls[kov::test::kFaultKinds] = {};
    std::uint64_t bytesAfterInserts = 0;
};

CleanRun measureCleanRun(bool shuffled) {
    CleanRun run;
    ScopedFaultVfs scoped;
    {
        Store store;
        store.insertAll(shuffled);
        for (int k = 0; k < kov::test::kFaultKinds; ++k)
            run.insertCalls[k] = scoped.faults().calls(static_cast<FaultKind>(k));
        run.bytesAfterInserts = scoped.faults().bytesInUse();
        for (int t = 0; t < kTables; ++t)
            store.walk(t);
    }
    for (int k = 0; k < kov::test::kFaultKinds; ++k)
        run.totalCalls[k] = scoped.faults().calls(static_cast<FaultKind>(k));
    return run;
}

// kSteps fault points spread over 1..calls, the first call included.
std::vector<std::uint64_t> faultPoints(std::uint64_t calls) {
    std::vector<std::uint64_t> points;
    for (int s = 0; s < kSteps; ++s) {
        std::uint64_t n = 1 + calls * static_cast<std::uint64_t>(s) / kSteps;
        if (points.empty() || points.back() != n)
            points.push_back(n);
    }
    return points;
}

const char* modeName(FaultMode mode) {
    return mode == FaultMode::Once ? "once" : "persistent";
}

// After a failure, which ends the engine's write transaction: every insert,
// table creation and drop is refused with SQLITE_ERROR and changes nothing;
// each table still reads back its model (checked by the caller where that
// holds). Reads are not refused.
void expectWritesRefused(Store& store) {
    EXPECT_FALSE(store.writable());
    for (int t = 0; t < kTables; ++t)
        EXPECT_EQ(store.insert(t, kRecords + 5), SQLITE_ERROR) << "table " << t;
    store.closeCursors();
    std::uint32_t root = 0;
    EXPECT_EQ(sqlite3BtreeCreateTable(store.bt, &root, 0), SQLITE_ERROR);
    EXPECT_EQ(root, 0u);
    int moved = -1;
    EXPECT_EQ(sqlite3BtreeDropTable(store.bt, store.root[0], &moved), SQLITE_ERROR);
    EXPECT_EQ(moved, -1);
    EXPECT_EQ(store.reopenCursors(), SQLITE_OK);
    EXPECT_FALSE(store.writable());
}

// Inserts stopped at the first failure, which refused its insert and changed nothing: every later
// insert was refused (`failures` in all), and every table holds exactly the entries inserted
// before the failure.
void expectEveryEntryBeforeTheFailure(Store& store, int failures) {
    EXPECT_EQ(failures, kRecords * kTables - store.firstFailureAt);
    EXPECT_EQ(store.refusedAfterFirst, failures - 1);
    std::size_t total = 0;
    for (int t = 0; t < kTables; ++t) {
        EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
        total += store.model[t].size();
    }
    EXPECT_EQ(total, static_cast<std::size_t>(store.firstFailureAt));
}

// The failure the engine kept: its first one, with SQLite's extended code and what the engine
// was doing. Later failures and refusals do not replace it.
void expectFailureKept(Store& store, int code, const std::string& operation) {
    const char* doing = nullptr;
    EXPECT_EQ(sqlite3BtreeFailure(store.bt, &doing), code);
    ASSERT_NE(doing, nullptr);
    EXPECT_EQ(std::string(doing), operation);
}

// A fresh engine, opened once the faulty one is closed and the fault is gone,
// works as if nothing had happened (what the store's reset gives).
void expectFreshEngineWorks() {
    Store fresh;
    ASSERT_TRUE(fresh.ready());
    for (int t = 0; t < kTables; ++t) {
        EXPECT_EQ(fresh.insert(t, 7), SQLITE_OK);
        EXPECT_TRUE(fresh.holdsModel(t)) << "table " << t;
    }
    EXPECT_EQ(fresh.close(), SQLITE_OK);
}

// After a failed write or a full disk: SQLite's pager keeps the failure and
// answers every later page request with it, so everything the store had is
// out of reach: every table answers First with that code (SQLITE_IOERR, or
// SQLITE_FULL for a full disk), and writes are refused, beginning the
// transaction again included.
void expectEverythingLost(Store& store, int faultRc) {
    EXPECT_FALSE(store.writable());
    for (int t = 0; t < kTables; ++t) {
        Walk w = store.walk(t);
        EXPECT_EQ(w.rc, faultRc) << "table " << t;
        EXPECT_TRUE(w.records.empty()) << "table " << t;
        EXPECT_EQ(sqlite3BtreeEof(store.cursor[t]), 1);
    }
    expectWritesRefused(store);
    EXPECT_EQ(sqlite3BtreeBeginTrans(store.bt, 2), SQLITE_ERROR);
    EXPECT_EQ(store.insert(kIntTable, kRecords + 2), SQLITE_ERROR);
    EXPECT_FALSE(store.writable());
}

}  // namespace

TEST(FaultVfs, WrapsTheDefaultAndRestoresItOnDestruction) {
    // The default, once the engine's temporary-file layer is installed, is that layer.
    ASSERT_TRUE(kov::engine::installTemporaryFiles());
    sqlite3_vfs* before = sqlite3_vfs_find(nullptr);
    ASSERT_NE(before, nullptr);
    EXPECT_EQ(before, sqlite3_vfs_find(kov::engine::kTemporaryFileLayer));
    {
        ScopedFaultVfs scoped;
        ASSERT_EQ(scoped.registerRc(), SQLITE_OK);
        EXPECT_EQ(sqlite3_vfs_find(nullptr), scoped.faults().vfs());
        EXPECT_EQ(scoped.faults().wrapped(), before);
    }
    EXPECT_EQ(sqlite3_vfs_find(nullptr), before);
    EXPECT_EQ(sqlite3_vfs_find("kov-fault"), nullptr);
}

TEST(FaultVfs, CountsTheEngineFileCallsAndItsTemporaryFile) {
    ScopedFaultVfs scoped;
    FaultVfs& f = scoped.faults();
    {
        Store store;
        ASSERT_TRUE(store.ready());
        EXPECT_EQ(f.calls(FaultKind::Open), 0u);  // no file until the cache spills
        EXPECT_EQ(store.insertAll(false), 0);
        EXPECT_EQ(f.calls(FaultKind::Open), 1u);
        EXPECT_EQ(f.calls(FaultKind::TempOpen), 1u);
        EXPECT_GT(f.calls(FaultKind::Write), 100u);
        EXPECT_GT(f.bytesInUse(), 1000000u);
        EXPECT_GE(f.bytesWritten(), f.bytesInUse() / 2);
        for (int t = 0; t < kTables; ++t)
            EXPECT_TRUE(store.holdsModel(t));
        EXPECT_GT(f.calls(FaultKind::Read), 100u);
        EXPECT_EQ(store.close(), SQLITE_OK);
    }
    // The temporary file gives its bytes back when it is closed.
    EXPECT_EQ(f.bytesInUse(), 0u);
    for (int k = 0; k < kov::test::kFaultKinds; ++k)
        EXPECT_EQ(f.injected(static_cast<FaultKind>(k)), 0u);
    f.resetCounters();
    EXPECT_EQ(f.calls(FaultKind::Write), 0u);
}

TEST(FaultVfs, OnceFailsOneCallAndPersistentEveryLaterOne) {
    // The first engine stops writing at the refused file; a second one in
    // the same fault setting makes the next attempt.
    ScopedFaultVfs scoped;
    FaultVfs& f = scoped.faults();
    f.failAt(FaultKind::TempOpen, 1, FaultMode::Once);
    for (int attempt = 1; attempt <= 2; ++attempt) {
        Store store;
        ASSERT_TRUE(store.ready());
        store.insertAll(false);
        EXPECT_EQ(f.calls(FaultKind::TempOpen), static_cast<std::uint64_t>(attempt));
        EXPECT_EQ(f.injected(FaultKind::TempOpen), 1u);  // the second attempt opened it
        EXPECT_EQ(store.firstFailureRc, attempt == 1 ? SQLITE_CANTOPEN : SQLITE_OK);
    }
    f.resetCounters();
    f.failAt(FaultKind::TempOpen, 1, FaultMode::Persistent);
    for (int attempt = 1; attempt <= 2; ++attempt) {
        Store store;
        ASSERT_TRUE(store.ready());
        store.insertAll(false);
        EXPECT_EQ(f.injected(FaultKind::TempOpen), static_cast<std::uint64_t>(attempt));
        EXPECT_EQ(f.injected(FaultKind::TempOpen), f.calls(FaultKind::TempOpen));
        EXPECT_EQ(f.injected(FaultKind::Open), 0u);
    }
    f.clearAll();
}

// Neither truncation nor sync happens in the store's use of the engine (no
// commit, no journal, synchronous off): faults of these kinds change nothing.
TEST(EngineFaults, TruncateAndSyncAreNeverCalled) {
    CleanRun run = measureCleanRun(false);
    EXPECT_EQ(run.totalCalls[static_cast<int>(FaultKind::Truncate)], 0u);
    EXPECT_EQ(run.totalCalls[static_cast<int>(FaultKind::Sync)], 0u);

    ScopedFaultVfs scoped;
    scoped.faults().failAt(FaultKind::Truncate, 1, FaultMode::Persistent);
    scoped.faults().failAt(FaultKind::Sync, 1, FaultMode::Persistent);
    Store store;
    ASSERT_TRUE(store.ready());
    EXPECT_EQ(store.insertAll(true), 0);
    EXPECT_TRUE(store.writable());
    for (int t = 0; t < kTables; ++t) {
        EXPECT_TRUE(store.holdsModel(t));
        EXPECT_EQ(store.model[t].size(), static_cast<std::size_t>(kRecords));
    }
    EXPECT_EQ(store.close(), SQLITE_OK);
    EXPECT_EQ(scoped.faults().injected(FaultKind::Truncate), 0u);
    EXPECT_EQ(scoped.faults().injected(FaultKind::Sync), 0u);
}

// A failed write while the cache spills: SQLite's pager keeps the failure
// and refuses every later page request with it, so every table is lost, and
// every later write is refused with SQLITE_ERROR, also after the fault is
// gone, until the engine is closed. A fresh engine works.
TEST(EngineFaults, WriteErrorLosesEveryTableForGood) {
    CleanRun run = measureCleanRun(false);
    std::uint64_t writes = run.insertCalls[static_cast<int>(FaultKind::Write)];
    ASSERT_GT(writes, 0u);
    for (FaultMode mode : {FaultMode::Once, FaultMode::Persistent}) {
        for (std::uint64_t n : faultPoints(writes)) {
            SCOPED_TRACE(std::string(modeName(mode)) + " write fault at call " + std::to_string(n));
            ScopedFaultVfs scoped;
            Store store;
            ASSERT_TRUE(store.ready());
            scoped.faults().failAt(FaultKind::Write, n, mode);
            int failures = store.insertAll(false);
            EXPECT_EQ(scoped.faults().injected(FaultKind::Write), 1u);
            EXPECT_GT(failures, 0);
            EXPECT_EQ(store.firstFailureRc, SQLITE_IOERR);
            // Every insert after the failed one is refused.
            EXPECT_EQ(failures, kRecords * kTables - store.firstFailureAt);
            EXPECT_EQ(store.refusedAfterFirst, failures - 1);
            expectEverythingLost(store, SQLITE_IOERR);
            scoped.faults().clearAll();
            expectEverythingLost(store, SQLITE_IOERR);
            expectFailureKept(store, SQLITE_IOERR_WRITE, "inserting an entry");
            EXPECT_EQ(store.close(), SQLITE_OK);
            expectFreshEngineWorks();
        }
    }
}

// A full disk, reached at any point of a load (straight inserts, in key order and all over the
// tables): room is reserved ahead of every page the engine holds, so the insert that needs room
// the disk does not have is refused with SQLITE_FULL before it changes anything, and no page
// write ever meets the full disk. Every entry inserted before reads back in every table; every
// later insert is refused with SQLITE_ERROR, also once space comes back; a fresh engine works.
TEST(EngineFaults, FullDiskRefusesTheInsertThatNeedsRoomAndLosesNothing) {
    for (bool shuffled : {false, true}) {
        CleanRun run = measureCleanRun(shuffled);
        ASSERT_GT(run.bytesAfterInserts, 0u);
        for (std::uint64_t step = 0; step < kSteps; ++step) {
            std::uint64_t budget = run.bytesAfterInserts * step / kSteps;
            SCOPED_TRACE("space budget " + std::to_string(budget) +
                         (shuffled ? ", shuffled" : ", in order"));
            ScopedFaultVfs scoped;
            Store store;
            ASSERT_TRUE(store.ready());
            scoped.faults().setSpaceBudget(budget);
            int failures = store.insertAll(shuffled);
            EXPECT_GT(scoped.faults().fullRefusals(), 0u);
            EXPECT_LE(scoped.faults().bytesInUse(), budget);
            EXPECT_EQ(scoped.faults().calls(FaultKind::Write) > 0,
                      scoped.faults().bytesWritten() > 0);
            EXPECT_EQ(store.firstFailureRc, SQLITE_FULL);
            expectEveryEntryBeforeTheFailure(store, failures);
            expectWritesRefused(store);
            scoped.faults().setSpaceBudget(run.bytesAfterInserts * 4);
            expectWritesRefused(store);
            for (int t = 0; t < kTables; ++t)
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
            expectFailureKept(store, SQLITE_FULL, "inserting an entry");
            EXPECT_EQ(store.close(), SQLITE_OK);
            EXPECT_EQ(scoped.faults().bytesInUse(), 0u);
            expectFreshEngineWorks();
        }
    }
}

// Reservations refused by the system (an injected fault from each point of a clean run's
// reservations on). Refused once: the engine asks again for exactly the room it needs instead of
// a step ahead, and goes on. Refused from then on: the insert that needed room is refused like
// one on a full disk, and nothing is lost.
TEST(EngineFaults, RefusedReservationsLoseNothing) {
    CleanRun run = measureCleanRun(true);
    const std::uint64_t reservations = run.insertCalls[static_cast<int>(FaultKind::Reserve)];
    ASSERT_GT(reservations, 1u);
    for (FaultMode mode : {FaultMode::Once, FaultMode::Persistent}) {
        for (std::uint64_t n = 1; n <= reservations; ++n) {
            SCOPED_TRACE(std::string(modeName(mode)) + " from reservation " + std::to_string(n));
            ScopedFaultVfs scoped;
            Store store;
            ASSERT_TRUE(store.ready());
            scoped.faults().failAt(FaultKind::Reserve, n, mode);
            const int failures = store.insertAll(true);
            EXPECT_GE(scoped.faults().injected(FaultKind::Reserve), 1u);
            for (int t = 0; t < kTables; ++t)
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
            if (mode == FaultMode::Once) {
                EXPECT_EQ(failures, 0);
                EXPECT_TRUE(store.writable());
            } else {
                EXPECT_EQ(store.firstFailureRc, SQLITE_FULL);
                expectWritesRefused(store);
                expectFailureKept(store, SQLITE_FULL, "inserting an entry");
            }
            EXPECT_EQ(store.close(), SQLITE_OK);
        }
    }
}

namespace {

// Inserts all over the tables (evicted pages are read back) with a read
// fault armed at each fault point, in the given mode; the fault is cleared
// once the inserts are done. What every point must show is written at the
// tests below.
void expectReadErrorDuringInsertsStopsWrites(FaultMode mode) {
    CleanRun run = measureCleanRun(true);
    std::uint64_t reads = run.insertCalls[static_cast<int>(FaultKind::Read)];
    ASSERT_GT(reads, 0u);
    int damagedPoints = 0;
    for (std::uint64_t n : faultPoints(reads)) {
        SCOPED_TRACE(std::string(modeName(mode)) + " read fault from call " + std::to_string(n));
        ScopedFaultVfs scoped;
        Store store;
        ASSERT_TRUE(store.ready());
        scoped.faults().failAt(FaultKind::Read, n, mode);
        int failures = store.insertAll(true);
        EXPECT_EQ(store.firstFailureRc, SQLITE_IOERR);
        EXPECT_EQ(failures, kRecords * kTables - store.firstFailureAt);
        EXPECT_EQ(store.refusedAfterFirst, failures - 1);
        EXPECT_EQ(scoped.faults().injected(FaultKind::Read), 1u);
        scoped.faults().clearAll();
        // The table being written when the read failed may be damaged if the read was inside a
        // page split (the test below); every other table holds what it was given.
        const int written = store.firstFailureAt % kTables;
        const bool damaged = !store.holdsModel(written);
        damagedPoints += damaged ? 1 : 0;
        std::size_t total = 0;
        for (int t = 0; t < kTables; ++t) {
            if (t != written) {
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
            }
            total += store.model[t].size();
        }
        EXPECT_EQ(total, static_cast<std::size_t>(store.firstFailureAt));
        expectWritesRefused(store);
        expectFailureKept(store, SQLITE_IOERR_READ, "inserting an entry");
        for (int t = 0; t < kTables; ++t) {
            if (t != written || !damaged) {
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
            }
        }
        EXPECT_EQ(store.close(), SQLITE_OK);
    }
    // Most fault points fall outside a split and keep every table whole.
    EXPECT_LT(damagedPoints, kSteps / 2);
    expectFreshEngineWorks();
}

}  // namespace

// A failed read while inserts land all over the tables, once: the insert
// that needed the page fails with SQLITE_IOERR and ends the write
// transaction. The cache survives it: every table holds exactly the entries
// inserted before, data intact (but the one being written, when the read was
// inside a page split: the test after the next). Every later insert is refused with
// SQLITE_ERROR, also once the fault is gone, until the engine is closed; a
// fresh engine works.
TEST(EngineFaults, ReadErrorDuringInsertsKeepsEveryEarlierEntryAndStopsWrites) {
    expectReadErrorDuringInsertsStopsWrites(FaultMode::Once);
}

// Read errors that go on, from the n-th read: the first one ends the write
// transaction, and from then on every insert is refused with SQLITE_ERROR
// before it reads anything, so no further fault is injected and nothing is
// lost: once the fault is gone every table reads back exactly the entries
// inserted before the failure.
TEST(EngineFaults, PersistentReadErrorsDuringInsertsStopWritesAndLoseNothing) {
    expectReadErrorDuringInsertsStopsWrites(FaultMode::Persistent);
}

// A failed read in the middle of an insert that is splitting pages: the table being written
// can come out damaged (entries missing, or SQLITE_CORRUPT), while the other tables keep every
// entry acknowledged before. Read fault points over the inserts all over the tables are tried
// until one lands inside a split. The failure ended the write transaction: every later insert is
// refused with SQLITE_ERROR.
TEST(EngineFaults, ReadErrorInsideAnInsertCanCorruptThatTable) {
    CleanRun run = measureCleanRun(true);
    const std::uint64_t reads = run.insertCalls[static_cast<int>(FaultKind::Read)];
    ASSERT_GT(reads, 0u);
    const std::uint64_t stride = reads / 400 + 1;
    bool found = false;
    for (std::uint64_t n = 1; n <= reads && !found; n += stride) {
        ScopedFaultVfs scoped;
        Store store;
        ASSERT_TRUE(store.ready());
        scoped.faults().failAt(FaultKind::Read, n, FaultMode::Once);
        int failures = store.insertAll(true);
        ASSERT_EQ(store.firstFailureRc, SQLITE_IOERR);
        scoped.faults().clearAll();
        const int written = store.firstFailureAt % kTables;
        if (store.holdsModel(written))
            continue;
        found = true;
        SCOPED_TRACE("read fault from call " + std::to_string(n));
        EXPECT_EQ(failures, kRecords * kTables - store.firstFailureAt);
        EXPECT_EQ(store.refusedAfterFirst, failures - 1);
        EXPECT_FALSE(store.writable());
        for (int t = 0; t < kTables; ++t) {
            Walk w = store.walk(t);
            EXPECT_TRUE(w.bounded);
            if (t == written) {
                EXPECT_TRUE(w.rc == SQLITE_CORRUPT || w.records.size() < store.model[t].size())
                    << "rc " << w.rc << ", " << w.records.size() << " of "
                    << store.model[t].size();
            } else {
                // Every acknowledged entry reads back, the ones before the failure included.
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
                EXPECT_GE(store.model[t].size(),
                          static_cast<std::size_t>(store.firstFailureAt / kTables))
                    << "table " << t;
            }
        }
        expectWritesRefused(store);
        expectFailureKept(store, SQLITE_IOERR_READ, "inserting an entry");
        EXPECT_EQ(store.close(), SQLITE_OK);
    }
    EXPECT_TRUE(found) << "no read fault point fell inside a page split";
    expectFreshEngineWorks();
}

// A failed read during a walk: the move that failed returns SQLITE_IOERR,
// leaves its flag unwritten and the cursor on no entry, and ends the write
// transaction. Nothing is lost: once the fault is gone every table reads
// back whole. Every later insert is refused with SQLITE_ERROR and changes
// nothing; a fresh engine works.
TEST(EngineFaults, ReadErrorDuringWalksLosesNothingAndStopsWrites) {
    // The reads one walk over the three tables makes, after clean inserts.
    std::uint64_t walkReads = 0;
    {
        CleanRun run = measureCleanRun(false);
        walkReads = run.totalCalls[static_cast<int>(FaultKind::Read)] -
                    run.insertCalls[static_cast<int>(FaultKind::Read)];
    }
    ASSERT_GT(walkReads, 0u);
    for (FaultMode mode : {FaultMode::Once, FaultMode::Persistent}) {
        for (std::uint64_t n : faultPoints(walkReads)) {
            SCOPED_TRACE(std::string(modeName(mode)) + " read fault at walk read " +
                         std::to_string(n));
            ScopedFaultVfs scoped;
            Store store;
            ASSERT_TRUE(store.ready());
            ASSERT_EQ(store.insertAll(false), 0);
            scoped.faults().failAt(FaultKind::Read, n, mode);
            int failedWalks = 0;
            for (int t = 0; t < kTables; ++t) {
                Walk w = store.walk(t);
                EXPECT_TRUE(w.bounded);
                EXPECT_TRUE(w.intact);
                if (w.rc != SQLITE_OK) {
                    ++failedWalks;
                    EXPECT_EQ(w.rc, SQLITE_IOERR);
                    EXPECT_LT(w.records.size(), static_cast<std::size_t>(kRecords));
                    EXPECT_EQ(sqlite3BtreeEof(store.cursor[t]), 1);
                    std::int64_t keySize = -1;
                    EXPECT_EQ(sqlite3BtreeKeySize(store.cursor[t], &keySize), SQLITE_OK);
                    EXPECT_EQ(keySize, 0);
                }
            }
            EXPECT_GE(failedWalks, 1);
            EXPECT_GE(scoped.faults().injected(FaultKind::Read), 1u);
            EXPECT_FALSE(store.writable());

            // A failed move leaves its flag as it was.
            if (mode == FaultMode::Persistent) {
                int flag = 42;
                int rc = sqlite3BtreeFirst(store.cursor[0], &flag);
                if (rc != SQLITE_OK) {
                    EXPECT_EQ(flag, 42);
                }
            }

            scoped.faults().clearAll();
            for (int t = 0; t < kTables; ++t) {
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
                EXPECT_EQ(store.model[t].size(), static_cast<std::size_t>(kRecords));
            }
            expectWritesRefused(store);
            expectFailureKept(store, SQLITE_IOERR_READ, "moving a cursor");
            for (int t = 0; t < kTables; ++t) {
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
                EXPECT_EQ(store.model[t].size(), static_cast<std::size_t>(kRecords));
            }
            EXPECT_EQ(store.close(), SQLITE_OK);
        }
    }
    expectFreshEngineWorks();
}

// The temporary file cannot be created (at the first spill), once or for
// good: the insert that needed the spill fails with SQLITE_CANTOPEN and ends
// the write transaction, so every later insert is refused with SQLITE_ERROR
// and nothing is written again. Nothing had reached the file, and the cache
// still holds every page: every entry acknowledged before reads back, the
// refused one is absent. A fresh engine works once the file can be made.
TEST(EngineFaults, TemporaryFileRefusedStopsWritesAndKeepsEveryEntry) {
    for (FaultMode mode : {FaultMode::Once, FaultMode::Persistent}) {
        for (FaultKind kind : {FaultKind::TempOpen, FaultKind::Open}) {
            SCOPED_TRACE(std::string(modeName(mode)) +
                         (kind == FaultKind::Open ? " open" : " temporary open"));
            ScopedFaultVfs scoped;
            Store store;
            ASSERT_TRUE(store.ready());
            scoped.faults().failAt(kind, 1, mode);
            int failures = store.insertAll(false);
            EXPECT_EQ(scoped.faults().injected(kind), 1u);
            EXPECT_EQ(store.firstFailureRc, SQLITE_CANTOPEN);
            expectEveryEntryBeforeTheFailure(store, failures);
            scoped.faults().clearAll();
            expectWritesRefused(store);
            expectFailureKept(store, SQLITE_CANTOPEN, "inserting an entry");
            for (int t = 0; t < kTables; ++t)
                EXPECT_TRUE(store.holdsModel(t)) << "table " << t;
            EXPECT_EQ(store.close(), SQLITE_OK);
            expectFreshEngineWorks();
        }
    }
}
