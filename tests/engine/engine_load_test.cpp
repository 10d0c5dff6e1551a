// Loads: inserts gathered while nothing reads their table, written out in sorted runs and merged
// at the next read; and the insert after a search of the same key, which goes where the search
// stopped. Checked against std::map models, with SQLite's integrity check after each run.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"

#include "engine/private_sqlite3.h"
// after SQLite's header
#include "fault_vfs.h"

namespace {

using namespace kov::engine;        // NOLINT(google-build-using-namespace)
using namespace kov::engine::test;  // NOLINT(google-build-using-namespace)

std::string keyOf(std::uint64_t i) {
    char buf[24];
    std::snprintf(buf, sizeof buf, "key%012llu", static_cast<unsigned long long>(i));
    return buf;
}

// A buffer of a few dozen small entries, gathered from the first insert after a read.
constexpr LoadLimits kSmallRuns{4096, 0};

std::vector<std::pair<std::string, std::string>> modelRows(
    const std::map<std::string, std::string>& model) {
    return {model.begin(), model.end()};
}

// Pages the connection asked its cache for so far (hits and misses).
long long pageRequests(Btree* engine) {
    long long total = 0;
    for (int op : {SQLITE_DBSTATUS_CACHE_HIT, SQLITE_DBSTATUS_CACHE_MISS}) {
        int current = 0;
        int highest = 0;
        sqlite3_db_status(TEST_connection(engine), op, &current, &highest, 0);
        total += current;
    }
    return total;
}

}  // namespace

// A load into an empty table, in random order, with nothing read: every full buffer is written
// out as a run, and the runs and the last buffer are merged into the table by appending at the
// first read. Every entry reads back; the database is whole.
TEST(EngineLoads, GatheredLoadGoesInRunsAndIsMergedAtTheFirstRead) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kByteTable), 1);
    std::map<std::string, std::string> model;
    std::mt19937 rng(7);
    for (int i = 0; i < 3000; ++i) {
        const std::string key = keyOf(rng() % 100000);
        const std::string data = patternBytes(rng() % 50, static_cast<unsigned>(i));
        ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK);
        model[key] = data;
    }
    const LoadStats before = TEST_loadStats(engine.get());
    EXPECT_EQ(before.gathered, 3000u);
    EXPECT_GT(before.runsWritten, 10u);
    EXPECT_EQ(before.merges, 0u);
    EXPECT_TRUE(walkBytes(cur.get()) == modelRows(model));
    const LoadStats after = TEST_loadStats(engine.get());
    EXPECT_EQ(after.merges, 1u);
    EXPECT_EQ(after.mergedByAppend, 1u);
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

// A load in key order never goes through a run: each buffer that fills is appended to the table.
TEST(EngineLoads, LoadInKeyOrderIsAppendedWithoutRuns) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kIntTable), 1);
    for (std::int64_t k = 0; k < 5000; ++k)
        ASSERT_EQ(insertInt(cur.get(), k, patternBytes(20, static_cast<unsigned>(k))), SQLITE_OK);
    const LoadStats stats = TEST_loadStats(engine.get());
    EXPECT_EQ(stats.runsWritten, 0u);
    EXPECT_GT(stats.mergedByAppend, 50u);
    EXPECT_EQ(stats.merges, stats.mergedByAppend);
    const auto rows = walkInts(cur.get());
    ASSERT_EQ(rows.size(), 5000u);
    for (std::int64_t k = 0; k < 5000; ++k) {
        ASSERT_EQ(rows[static_cast<std::size_t>(k)].first, k);
        ASSERT_EQ(rows[static_cast<std::size_t>(k)].second,
                  patternBytes(20, static_cast<unsigned>(k)));
    }
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

// The same key inserted again and again, in the buffer and across runs: the last insert wins.
TEST(EngineLoads, EqualKeysAcrossRunsKeepTheLastEntry) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kIntTable), 1);
    std::map<std::int64_t, std::string> model;
    for (int round = 0; round < 20; ++round) {
        for (std::int64_t k = 0; k < 100; ++k) {
            const std::string data = "r" + std::to_string(round) + "k" + std::to_string(k);
            if ((k + round) % 3 == 0)
                continue;
            ASSERT_EQ(insertInt(cur.get(), k, data), SQLITE_OK);
            model[k] = data;
        }
    }
    EXPECT_GT(TEST_loadStats(engine.get()).runsWritten, 5u);
    std::vector<std::pair<std::int64_t, std::string>> want(model.begin(), model.end());
    EXPECT_TRUE(walkInts(cur.get()) == want);
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

// A second load into a full table, keys interleaved with the first: merged by inserts in key
// order. Then a load of larger keys only: merged by appending.
TEST(EngineLoads, LoadIntoAFullTableIsMergedInKeyOrder) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kKeyOnlyTable), 1);
    std::map<std::string, std::string> model;
    for (int phase = 0; phase < 3; ++phase) {
        for (int i = 0; i < 2000; ++i) {
            // Phases 0 and 1 interleave (even and odd numbers); phase 2 lies above both.
            const std::uint64_t n = phase < 2 ? 2 * static_cast<std::uint64_t>(i) + phase
                                              : 10000 + static_cast<std::uint64_t>(i);
            ASSERT_EQ(insertBytes(cur.get(), keyOf(n * 7919 % 100000 + (phase == 2) * 100000)),
                      SQLITE_OK);
            model[keyOf(n * 7919 % 100000 + (phase == 2) * 100000)] = "";
        }
        EXPECT_TRUE(walkBytes(cur.get()) == modelRows(model)) << "phase " << phase;
    }
    const LoadStats stats = TEST_loadStats(engine.get());
    // Into the empty table (first buffer) and above every key (phase 2): by appending; phases 1
    // and 2 leave runs, merged at their walks; phase 1 by inserts in key order.
    EXPECT_GT(stats.runsWritten, 0u);
    EXPECT_GT(stats.merges, stats.mergedByAppend);
    EXPECT_GE(stats.mergedByAppend, 2u);
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

// Opening a read cursor, Last and a search are reads too: each merges what was gathered before
// it answers.
TEST(EngineLoads, EveryKindOfReadSeesEverythingInserted) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    const std::uint32_t root = engine.createTable(kIntTable);
    TestCursor writer(engine.get(), root, 1);
    for (std::int64_t k = 0; k < 500; ++k)
        ASSERT_EQ(insertInt(writer.get(), 1000 - k, "a"), SQLITE_OK);
    {
        TestCursor reader(engine.get(), root, 0);  // locks writers out: the load went in first
        EXPECT_EQ(walkInts(reader.get()).size(), 500u);
    }
    for (std::int64_t k = 0; k < 500; ++k)
        ASSERT_EQ(insertInt(writer.get(), -k, "b"), SQLITE_OK);
    int res = 1;
    ASSERT_EQ(sqlite3BtreeLast(writer.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentIntKey(writer.get()), 1000);
    for (std::int64_t k = 0; k < 500; ++k)
        ASSERT_EQ(insertInt(writer.get(), 5000 + k, "c"), SQLITE_OK);
    EXPECT_EQ(seekInt(writer.get(), 5499), 0);
    EXPECT_EQ(currentData(writer.get()), "c");
    EXPECT_GE(TEST_loadStats(engine.get()).merges, 3u);
    EXPECT_EQ(walkInts(writer.get()).size(), 1500u);
}

// A dropped table takes what it gathered with it; its run trees serve the next table's runs, and
// no page is left that belongs to nothing.
TEST(EngineLoads, DroppedTableDiscardsWhatItGathered) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    for (int round = 0; round < 3; ++round) {
        const std::uint32_t root = engine.createTable(kByteTable);
        {
            TestCursor cur(engine.get(), root, 1);
            for (int i = 0; i < 1000; ++i)
                ASSERT_EQ(insertBytes(cur.get(), keyOf(static_cast<std::uint64_t>(i) * 31 % 1000),
                                      "data"),
                          SQLITE_OK);
        }
        int moved = -1;
        ASSERT_EQ(sqlite3BtreeDropTable(engine.get(), root, &moved), SQLITE_OK);
        EXPECT_EQ(integrityProblems(engine.get()), "") << "round " << round;
    }
    const LoadStats dropped = TEST_loadStats(engine.get());
    EXPECT_GT(dropped.runsWritten, 2u);
    const std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    EXPECT_TRUE(walkBytes(cur.get()).empty());
    EXPECT_EQ(TEST_loadStats(engine.get()).merges, dropped.merges);
}

// Several tables loading at once share one memory budget: the largest buffer is written out when
// it is full, and every table reads back whole. Closing the engine with loads pending frees them.
TEST(EngineLoads, TablesLoadingTogetherShareTheBuffer) {
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    const int kinds[] = {kByteTable, kIntTable, kKeyOnlyTable};
    std::uint32_t roots[3];
    for (int t = 0; t < 3; ++t)
        roots[t] = engine.createTable(kinds[t]);
    {
        TestCursor c0(engine.get(), roots[0], 1);
        TestCursor c1(engine.get(), roots[1], 1);
        TestCursor c2(engine.get(), roots[2], 1);
        std::map<std::string, std::string> bytes;
        std::map<std::string, std::string> keys;
        std::map<std::int64_t, std::string> ints;
        for (int i = 0; i < 2000; ++i) {
            const std::string key = keyOf(static_cast<std::uint64_t>(i) * 7 % 2000);
            ASSERT_EQ(insertBytes(c0.get(), key, "d" + key), SQLITE_OK);
            ASSERT_EQ(insertInt(c1.get(), i * 13 % 2000, key), SQLITE_OK);
            ASSERT_EQ(insertBytes(c2.get(), key), SQLITE_OK);
            bytes[key] = "d" + key;
            ints[i * 13 % 2000] = key;
            keys[key] = "";
        }
        EXPECT_TRUE(walkBytes(c0.get()) == modelRows(bytes));
        std::vector<std::pair<std::int64_t, std::string>> want(ints.begin(), ints.end());
        EXPECT_TRUE(walkInts(c1.get()) == want);
        EXPECT_TRUE(walkBytes(c2.get()) == modelRows(keys));
        EXPECT_EQ(integrityProblems(engine.get()), "");
        for (int i = 0; i < 2000; ++i)
            ASSERT_EQ(insertInt(c1.get(), 5000 + i, "pending"), SQLITE_OK);
    }
    EXPECT_EQ(engine.close(), SQLITE_OK);  // with a load still gathered
}

// An insert of the key a search just found goes where the search stopped: replacing an entry of
// the same size asks the cache for no page at all, where a search from the root asks for every
// level. Checked on each kind of table.
TEST(EngineLoads, InsertAfterASearchOfItsKeyAsksForNoPage) {
    ScopedLoadLimits loads(kStraightLoads);
    for (int kind : {kByteTable, kIntTable}) {
        SCOPED_TRACE(kind == kIntTable ? "integer keys" : "byte-string keys");
        TestEngine engine;
        TestCursor cur(engine.get(), engine.createTable(kind), 1);
        auto insert = [&](std::uint64_t i, const std::string& data) {
            return kind == kIntTable
                       ? insertInt(cur.get(), static_cast<std::int64_t>(i), data)
                       : insertBytes(cur.get(), keyOf(i), data);
        };
        auto seek = [&](std::uint64_t i) {
            return kind == kIntTable ? seekInt(cur.get(), static_cast<std::int64_t>(i))
                                     : seekBytes(cur.get(), keyOf(i));
        };
        for (std::uint64_t i = 0; i < 20000; ++i)
            ASSERT_EQ(insert(i * 2, "00000000"), SQLITE_OK);
        const LoadStats before = TEST_loadStats(engine.get());

        ASSERT_EQ(seek(5000), 0);
        long long requests = pageRequests(engine.get());
        ASSERT_EQ(insert(5000, "00000001"), SQLITE_OK);
        EXPECT_EQ(pageRequests(engine.get()) - requests, 0) << "replace in place";

        ASSERT_EQ(seek(7000), 0);
        requests = pageRequests(engine.get());
        ASSERT_EQ(insert(7001, "00000001"), SQLITE_OK);  // another key: searched for
        EXPECT_GE(pageRequests(engine.get()) - requests, 2) << "a search from the root";

        EXPECT_EQ(TEST_loadStats(engine.get()).insertsAfterSearch, before.insertsAfterSearch + 1);
        ASSERT_EQ(seek(5000), 0);
        EXPECT_EQ(currentData(cur.get()), "00000001");
        EXPECT_EQ(integrityProblems(engine.get()), "");
    }
}

// The insert after a search that missed goes next to where the search stopped: before the larger
// neighbour, after the last entry, into an empty table; and the search's result is forgotten once
// the cursor moves or another key is inserted.
TEST(EngineLoads, InsertAfterAMissedSearchLandsInOrder) {
    ScopedLoadLimits loads(kStraightLoads);
    TestEngine engine;
    const std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    TestCursor other(engine.get(), root, 1);
    std::map<std::string, std::string> model;
    std::mt19937 rng(11);
    for (int i = 0; i < 20000; ++i) {
        const std::string key = keyOf(rng() % 50000);
        const std::string data = patternBytes(rng() % 30, static_cast<unsigned>(i));
        seekBytes(cur.get(), key);
        if (rng() % 8 == 0) {
            int res = 0;
            sqlite3BtreeNext(cur.get(), &res);  // moved: the search no longer counts
        }
        if (rng() % 16 == 0) {
            ASSERT_EQ(insertBytes(other.get(), keyOf(rng() % 50000 + 50000), "o"), SQLITE_OK);
        }
        ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK);
        model[key] = data;
    }
    EXPECT_GT(TEST_loadStats(engine.get()).insertsAfterSearch, 10000u);
    std::map<std::string, std::string> all = model;
    for (const auto& row : walkBytes(other.get())) {
        if (row.second == "o")
            all[row.first] = "o";
    }
    EXPECT_TRUE(walkBytes(cur.get()) == modelRows(all));
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

// An insert that went before the entry its search stopped on, when that entry had been read: the
// cursor's cell is the new entry now, and a search for the old one through the same cursor must
// find the old one (SQLite kept believing it still stood on it). Found by the soak program
// (seed 2098357253) as data of the wrong entry read back.
TEST(EngineLoads, SearchAfterAnInsertBeforeTheEntryASearchStoppedOn) {
    ScopedLoadLimits loads(kStraightLoads);
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kIntTable), 1);
    for (std::int64_t k = 0; k < 100; k += 10)
        ASSERT_EQ(insertInt(cur.get(), k, "k" + std::to_string(k)), SQLITE_OK);
    ASSERT_GT(seekInt(cur.get(), 25), 0);
    ASSERT_EQ(currentData(cur.get()), "k30");  // the cell is read: SQLite knows its key
    ASSERT_EQ(insertInt(cur.get(), 25, "k25"), SQLITE_OK);
    EXPECT_EQ(TEST_loadStats(engine.get()).insertsAfterSearch, 1u);
    ASSERT_EQ(seekInt(cur.get(), 30), 0);
    EXPECT_EQ(currentIntKey(cur.get()), 30);
    EXPECT_EQ(currentData(cur.get()), "k30");
    ASSERT_EQ(insertInt(cur.get(), 30, "new"), SQLITE_OK);
    ASSERT_EQ(seekInt(cur.get(), 25), 0);
    EXPECT_EQ(currentData(cur.get()), "k25");
    ASSERT_EQ(seekInt(cur.get(), 30), 0);
    EXPECT_EQ(currentData(cur.get()), "new");
    EXPECT_EQ(integrityProblems(engine.get()), "");
}

namespace {

// What a load on a nearly full disk did: where the first refusal fell and what the engine's loads
// had done by then.
struct FullLoad {
    bool refused = false;
    int firstFailureRc = SQLITE_OK;
    LoadStats atRefusal;         // the loads' work before the refused insert
    LoadStats afterRefusal;      // and after it (it may have merged every load to make room)
    std::uint64_t fullRefusals = 0;
};

// Two tables loaded in random order through a 32-page cache with small runs, nothing read, until
// the first refused insert (or 6000 inserts each), the disk modelled as `budget` bytes; then the
// disk stays full, every table is read back and compared with the inserts that were accepted,
// and the database is checked. Writes stay refused.
FullLoad loadUntilFull(std::uint64_t budget) {
    FullLoad out;
    kov::test::ScopedFaultVfs vfs;
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    sqlite3BtreeSetCacheSize(engine.get(), 32);
    vfs.faults().setSpaceBudget(budget);
    const std::uint32_t byteRoot = engine.createTable(kByteTable);
    const std::uint32_t intRoot = engine.createTable(kIntTable);
    EXPECT_NE(byteRoot, 0u);
    EXPECT_NE(intRoot, 0u);
    TestCursor bytes(engine.get(), byteRoot, 1);
    TestCursor ints(engine.get(), intRoot, 1);
    std::map<std::string, std::string> byteModel;
    std::map<std::int64_t, std::string> intModel;
    std::mt19937 rng(11);
    for (int i = 0; i < 6000 && !out.refused; ++i) {
        const std::string key = keyOf(rng() % 1000000);
        const std::string data = patternBytes(20 + rng() % 200, static_cast<unsigned>(i));
        const std::int64_t k = static_cast<std::int64_t>(rng() % 1000000);
        const LoadStats before = TEST_loadStats(engine.get());
        int rc = insertBytes(bytes.get(), key, data);
        if (rc == SQLITE_OK) {
            byteModel[key] = data;
            rc = insertInt(ints.get(), k, data);
            if (rc == SQLITE_OK)
                intModel[k] = data;
        }
        if (rc != SQLITE_OK) {
            out.refused = true;
            out.firstFailureRc = rc;
            out.atRefusal = before;
            out.afterRefusal = TEST_loadStats(engine.get());
        }
    }
    out.fullRefusals = vfs.faults().fullRefusals();
    EXPECT_TRUE(walkBytes(bytes.get()) == modelRows(byteModel));
    std::vector<std::pair<std::int64_t, std::string>> wantInts(intModel.begin(), intModel.end());
    EXPECT_TRUE(walkInts(ints.get()) == wantInts);
    EXPECT_EQ(integrityProblems(engine.get()), "");
    EXPECT_LE(vfs.faults().bytesInUse(), budget);
    if (out.refused) {
        EXPECT_EQ(insertInt(ints.get(), -1, "after"), SQLITE_ERROR);
        EXPECT_EQ(sqlite3BtreeTxnState(engine.get()), SQLITE_TXN_READ);
        EXPECT_TRUE(sqlite3BtreeFailureWasRefusal(engine.get()));
    }
    return out;
}

}  // namespace

// The disk fills while loads are gathered, written out as runs and merged, at budgets spread from
// 256 KiB to about what the load needs: room is reserved ahead for every page held and for
// what every gathered load may still take, so the insert that needs room the disk does not have
// is refused (SQLITE_FULL) before it changes anything; every entry accepted before it, gathered,
// in runs or merged, reads back, and the database is sound. Some refusals come after runs were
// written, and some after every load was merged to make room.
TEST(EngineLoads, FullDiskWhileRunsAreWrittenAndMergedLosesNothing) {
    int refused = 0;
    int withRuns = 0;
    int afterMerging = 0;
    for (std::uint64_t kib = 256; kib <= 8192; kib += kib / 2) {
        SCOPED_TRACE("budget " + std::to_string(kib) + " KiB");
        const FullLoad load = loadUntilFull(kib * 1024);
        if (!load.refused)
            continue;
        ++refused;
        EXPECT_EQ(load.firstFailureRc, SQLITE_FULL);
        EXPECT_GT(load.fullRefusals, 0u);
        withRuns += load.atRefusal.runsWritten > 0 ? 1 : 0;
        afterMerging += load.afterRefusal.merges > load.atRefusal.merges ? 1 : 0;
    }
    EXPECT_GE(refused, 5);
    EXPECT_GT(withRuns, 0);
    EXPECT_GT(afterMerging, 0);
}

// Room is held for what a gathered load may still take; once the load is merged that room is
// spent, and the file gives it back (keeping a step ahead of the pages it holds).
TEST(EngineLoads, RoomHeldForALoadIsGivenBackOnceItIsMerged) {
    kov::test::ScopedFaultVfs vfs;
    ScopedLoadLimits loads(kSmallRuns);
    TestEngine engine;
    sqlite3BtreeSetCacheSize(engine.get(), 32);
    TestCursor cur(engine.get(), engine.createTable(kByteTable), 1);
    std::map<std::string, std::string> model;
    std::mt19937 rng(5);
    // A table that holds entries: the load is merged by inserts, its bound the larger one.
    for (int i = 0; i < 100; ++i) {
        const std::string key = keyOf(rng() % 10000000);
        ASSERT_EQ(insertBytes(cur.get(), key, "first"), SQLITE_OK);
        model[key] = "first";
    }
    ASSERT_TRUE(walkBytes(cur.get()) == modelRows(model));
    for (int i = 0; i < 40000; ++i) {
        const std::string key = keyOf(rng() % 10000000);
        const std::string data = patternBytes(100, static_cast<unsigned>(i));
        ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK);
        model[key] = data;
    }
    EXPECT_GT(TEST_loadStats(engine.get()).runsWritten, 100u);
    const std::uint64_t whileGathered = vfs.faults().bytesInUse();
    EXPECT_TRUE(walkBytes(cur.get()) == modelRows(model));
    const std::uint64_t merged = vfs.faults().bytesInUse();
    // The entries take about 5 MiB in the runs, then in the table, the runs' pages staying free
    // in the file; the room held for merging them by inserts (10/4 of their bytes) is given back.
    std::printf("held while gathered: %llu bytes, once merged: %llu bytes\n",
                static_cast<unsigned long long>(whileGathered),
                static_cast<unsigned long long>(merged));
    EXPECT_LT(merged, whileGathered * 4 / 5);
    EXPECT_EQ(integrityProblems(engine.get()), "");
}
