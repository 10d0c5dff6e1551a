// Model-based randomised test of the engine binding: several cursors on tables of the three kinds
// move, search, read and insert at random, with keys and data from a few bytes to several pages
// (so entries run onto overflow pages) and a page cache cut to a few dozen pages (so pages go to
// the temporary file and come back). Every answer is compared with std::map models; the binding
// must also leave a database that SQLite's own integrity check passes.
//
// Steps include bursts of inserts through one cursor (so that, with loads gathered, buffers fill,
// runs are written and merged) and reads-modify-writes (a search, then an insert of the key
// searched through the same cursor, which goes where the search stopped without searching again).
// The same runs are made with every insert straight into its B-tree and with a load buffer of a
// few entries.
//
// KOV_ENGINE_MODEL_SEEDS=N runs N seeds instead of the default 40.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"

namespace {

using namespace kov::engine;        // NOLINT(google-build-using-namespace)
using namespace kov::engine::test;  // NOLINT(google-build-using-namespace)

constexpr int kTableFlags[] = {kByteTable, kIntTable, kKeyOnlyTable};
constexpr int kTables = 3;
constexpr int kCursors = 5;

// One table's model: byte-string keys as strings; integer keys as their 8 bytes in an order that
// sorts like the integers would not, so integer tables get a map of their own.
struct ModelTable {
    bool intKey = false;
    bool hasData = true;
    std::map<std::string, std::string> bytes;
    std::map<std::int64_t, std::string> ints;
    std::size_t size() const { return intKey ? ints.size() : bytes.size(); }
};

// Where a model cursor stands: on no entry, or on a key.
struct ModelCursor {
    int table = 0;
    bool on = false;
    std::string key;
    std::int64_t intKey = 0;
};

class EngineModelRun {
  public:
    explicit EngineModelRun(std::uint32_t seed) : rng_(seed), seed_(seed) {}

    void run(int steps) {
        ASSERT_NE(engine_.get(), nullptr);
        ASSERT_EQ(sqlite3BtreeSetCacheSize(engine_.get(), 30), SQLITE_OK);
        for (int t = 0; t < kTables; ++t) {
            root_[t] = engine_.createTable(kTableFlags[t]);
            ASSERT_NE(root_[t], 0u);
            model_[t].intKey = kTableFlags[t] == kIntTable;
            model_[t].hasData = kTableFlags[t] != kKeyOnlyTable;
        }
        for (int c = 0; c < kCursors; ++c)
            open(c, static_cast<int>(rng_() % kTables));
        for (step_ = 0; step_ < steps && !::testing::Test::HasFailure(); ++step_)
            oneStep();
        for (auto& c : cursors_)
            c.reset();
        EXPECT_EQ(integrityProblems(engine_.get()), "") << where();
        stats_ = TEST_loadStats(engine_.get());
        for (int t = 0; t < kTables; ++t)
            expectTableMatches(t);
    }

    // What the engine's loads did in the run.
    const LoadStats& stats() const { return stats_; }

  private:
    std::string where() const {
        return "seed " + std::to_string(seed_) + " step " + std::to_string(step_) + ": ";
    }

    void open(int c, int table) {
        cursors_[c] = std::make_unique<TestCursor>(engine_.get(), root_[table], 1);
        ASSERT_EQ(cursors_[c]->rc, SQLITE_OK);
        mc_[c] = ModelCursor{};
        mc_[c].table = table;
    }

    // Keys from a small space (so inserts replace and searches land between keys), now and
    // then long enough to leave the page.
    std::string randomKey() {
        std::size_t len = rng_() % 8 == 0 ? 500 + rng_() % 3000 : rng_() % 6;
        std::string key(len, '\0');
        for (auto& ch : key)
            ch = static_cast<char>("\x00\x01\x7f\x80\xfe\xff"[rng_() % 6]);
        return key;
    }
    std::int64_t randomInt() {
        static const std::int64_t kEdges[] = {INT64_MIN, -1, 0, 1, INT64_MAX};
        if (rng_() % 10 == 0)
            return kEdges[rng_() % 5];
        return static_cast<std::int64_t>(rng_() % 2000) - 1000;
    }
    std::string randomData() {
        std::size_t len = rng_() % 6 == 0 ? 1000 + rng_() % 12000 : rng_() % 40;
        return patternBytes(len, static_cast<unsigned>(rng_()));
    }

    void oneStep() {
        const int c = static_cast<int>(rng_() % kCursors);
        lastOp_.clear();
        BtCursor* cur = cursors_[c]->get();
        ModelCursor& m = mc_[c];
        ModelTable& t = model_[m.table];
        switch (rng_() % 12) {
            case 0:
            case 1:
            case 8:  // insert
                insertRandom(cur, m);
                break;
            case 9: {  // a burst of inserts
                const int n = 1 + static_cast<int>(rng_() % 60);
                for (int i = 0; i < n && !::testing::Test::HasFatalFailure(); ++i)
                    insertRandom(cur, m);
                break;
            }
            case 10: {  // read, modify, write: a search, then an insert of the key searched
                lastOp_ = " after a search and an insert of its key";
                std::string d = randomData();
                int rc;
                if (t.intKey) {
                    const std::int64_t k = randomInt();
                    seekInt(cur, k);
                    rc = insertInt(cur, k, d);
                    t.ints[k] = d;
                } else {
                    const std::string k = randomKey();
                    seekBytes(cur, k);
                    rc = insertBytes(cur, k, d);
                    t.bytes[k] = t.hasData ? d : std::string();
                }
                ASSERT_EQ(rc, SQLITE_OK) << where() << "insert after a search";
                leaveTable(m.table);
                break;
            }
            case 2: {  // seek: the larger neighbour when there is one, else the last entry
                int res = 0;
                lastOp_ = " after a seek";
                if (t.intKey) {
                    std::int64_t k = randomInt();
                    res = seekInt(cur, k);
                    auto it = t.ints.lower_bound(k);
                    expectSeek(m, t, res, it == t.ints.end() ? 1 : (it->first == k ? 0 : 2),
                               it == t.ints.end() ? std::string() : std::string(),
                               it == t.ints.end() ? (t.ints.empty() ? 0 : t.ints.rbegin()->first)
                                                  : it->first);
                } else {
                    std::string k = randomKey();
                    res = seekBytes(cur, k);
                    auto it = t.bytes.lower_bound(k);
                    expectSeek(m, t, res, it == t.bytes.end() ? 1 : (it->first == k ? 0 : 2),
                               it == t.bytes.end() ? (t.bytes.empty() ? "" : t.bytes.rbegin()->first)
                                                   : it->first,
                               0);
                }
                break;
            }
            case 3:
            case 4: {  // first or last
                const bool first = rng_() % 2 == 0;
                lastOp_ = first ? " after first" : " after last";
                int res = 7;
                ASSERT_EQ(first ? sqlite3BtreeFirst(cur, &res) : sqlite3BtreeLast(cur, &res),
                          SQLITE_OK);
                EXPECT_EQ(res, t.size() == 0 ? 1 : 0) << where() << (first ? "first" : "last");
                m.on = t.size() != 0;
                if (m.on && t.intKey)
                    m.intKey = first ? t.ints.begin()->first : t.ints.rbegin()->first;
                if (m.on && !t.intKey)
                    m.key = first ? t.bytes.begin()->first : t.bytes.rbegin()->first;
                break;
            }
            case 5:
            case 6: {  // next or previous
                const bool forward = rng_() % 2 == 0;
                lastOp_ = forward ? " after next" : " after previous";
                int res = 7;
                ASSERT_EQ(forward ? sqlite3BtreeNext(cur, &res) : sqlite3BtreePrevious(cur, &res),
                          SQLITE_OK);
                stepModel(m, t, forward);
                EXPECT_EQ(res, m.on ? 0 : 1) << where() << (forward ? "next" : "previous");
                break;
            }
            case 7:  // another table
                if (rng_() % 4 == 0)
                    open(c, static_cast<int>(rng_() % kTables));
                break;
            default:
                break;
        }
        expectPosition(c);
    }

    void insertRandom(BtCursor* cur, const ModelCursor& m) {
        ModelTable& t = model_[m.table];
        int rc;
        if (t.intKey) {
            std::int64_t k = randomInt();
            std::string d = randomData();
            rc = insertInt(cur, k, d);
            t.ints[k] = d;
        } else {
            std::string k = randomKey();
            std::string d = randomData();
            rc = insertBytes(cur, k, d);
            t.bytes[k] = t.hasData ? d : std::string();
        }
        ASSERT_EQ(rc, SQLITE_OK) << where() << "insert";
        leaveTable(m.table);
    }

    // After an insert into a table every cursor on it is on no entry.
    void leaveTable(int table) {
        for (auto& other : mc_) {
            if (other.table == table)
                other.on = false;
        }
    }

    // kind: 0 equal, 2 on the larger neighbour, 1 no larger one (on the last entry, or on none in
    // an empty table).
    void expectSeek(ModelCursor& m, const ModelTable& t, int res, int kind,
                    const std::string& key, std::int64_t intKey) {
        m.on = t.size() != 0;
        m.key = key;
        m.intKey = intKey;
        if (kind == 0)
            EXPECT_EQ(res, 0) << where() << "seek equal";
        else if (kind == 2)
            EXPECT_GT(res, 0) << where() << "seek larger";
        else
            EXPECT_LT(res, 0) << where() << "seek beyond the last";
    }

    static void stepModel(ModelCursor& m, const ModelTable& t, bool forward) {
        if (!m.on)
            return;
        if (t.intKey) {
            auto it = forward ? t.ints.upper_bound(m.intKey) : t.ints.lower_bound(m.intKey);
            if (forward ? it == t.ints.end() : it == t.ints.begin()) {
                m.on = false;
                return;
            }
            m.intKey = forward ? it->first : std::prev(it)->first;
        } else {
            auto it = forward ? t.bytes.upper_bound(m.key) : t.bytes.lower_bound(m.key);
            if (forward ? it == t.bytes.end() : it == t.bytes.begin()) {
                m.on = false;
                return;
            }
            m.key = forward ? it->first : std::prev(it)->first;
        }
    }

    // The cursor stands where its model does, with the model's key and data.
    void expectPosition(int c) {
        BtCursor* cur = cursors_[c]->get();
        const ModelCursor& m = mc_[c];
        const ModelTable& t = model_[m.table];
        ASSERT_EQ(sqlite3BtreeEof(cur) == 0, m.on) << where() << "cursor " << c << " on an entry";
        if (!m.on)
            return;
        if (t.intKey) {
            ASSERT_EQ(currentIntKey(cur), m.intKey) << where() << "cursor " << c;
            EXPECT_TRUE(currentData(cur) == t.ints.at(m.intKey)) << where() << "data";
        } else {
            ASSERT_TRUE(currentKey(cur) == m.key) << where() << "cursor " << c << " key: "
                                                  << currentKey(cur).size() << " bytes, model "
                                                  << m.key.size() << " bytes" << lastOp_;
            EXPECT_TRUE(currentData(cur) == t.bytes.at(m.key)) << where() << "data";
            std::uint32_t amt = 0;
            const void* lent = sqlite3BtreeKeyFetch(cur, &amt);
            ASSERT_EQ(amt, m.key.size()) << where() << "lent key";
            EXPECT_TRUE(m.key.empty() || std::string(static_cast<const char*>(lent), amt) == m.key)
                << where() << "lent key";
        }
    }

    void expectTableMatches(int table) {
        TestCursor cur(engine_.get(), root_[table], 0);
        const ModelTable& t = model_[table];
        if (t.intKey) {
            auto got = walkInts(cur.get());
            std::vector<std::pair<std::int64_t, std::string>> want(t.ints.begin(), t.ints.end());
            EXPECT_TRUE(got == want) << where() << "table " << table;
        } else {
            auto got = walkBytes(cur.get());
            std::vector<std::pair<std::string, std::string>> want(t.bytes.begin(), t.bytes.end());
            EXPECT_TRUE(got == want) << where() << "table " << table;
        }
    }

    std::mt19937 rng_;
    std::string lastOp_;
    std::uint32_t seed_;
    int step_ = 0;
    TestEngine engine_;
    std::uint32_t root_[kTables] = {};
    ModelTable model_[kTables];
    std::unique_ptr<TestCursor> cursors_[kCursors];
    ModelCursor mc_[kCursors];
    LoadStats stats_;
};

int seedCount() {
    const char* v = std::getenv("KOV_ENGINE_MODEL_SEEDS");
    if (v != nullptr && std::atoi(v) > 0)
        return std::atoi(v);
    return 40;
}

}  // namespace

namespace {

// Runs every seed; returns what the loads did over all of them.
LoadStats runSeeds(const LoadLimits& limits) {
    ScopedLoadLimits loads(limits);
    LoadStats sum;
    const int seeds = seedCount();
    for (int seed = 1; seed <= seeds; ++seed) {
        EngineModelRun run(static_cast<std::uint32_t>(seed));
        run.run(3000);
        if (::testing::Test::HasFailure()) {
            ADD_FAILURE() << "first failing seed: " << seed;
            return sum;
        }
        sum.gathered += run.stats().gathered;
        sum.runsWritten += run.stats().runsWritten;
        sum.merges += run.stats().merges;
        sum.mergedByAppend += run.stats().mergedByAppend;
        sum.insertsAfterSearch += run.stats().insertsAfterSearch;
    }
    return sum;
}

}  // namespace

TEST(EngineModel, RandomCursorsOnEveryTableKindMatchTheModel) {
    const LoadStats stats = runSeeds(kStraightLoads);
    EXPECT_EQ(stats.gathered, 0u);
    EXPECT_GT(stats.insertsAfterSearch, 0u);
}

// The same programs with a load buffer of about a kilobyte: inserts are gathered from the second
// one after a read of their table, runs of a few entries are written and merged at the next read,
// into empty tables and full ones.
TEST(EngineModel, GatheredLoadsMatchTheModel) {
    const LoadStats stats = runSeeds(kTinyLoads);
    EXPECT_GT(stats.gathered, 0u);
    EXPECT_GT(stats.runsWritten, 0u);
    EXPECT_GT(stats.merges, stats.mergedByAppend);
    EXPECT_GT(stats.mergedByAppend, 0u);
    EXPECT_GT(stats.insertsAfterSearch, 0u);
}

// And with the store's own limits: bursts are gathered and merged, never spilled as runs.
TEST(EngineModel, DefaultLoadLimitsMatchTheModel) {
    const LoadStats stats = runSeeds(kDefaultLoadLimits);
    EXPECT_GT(stats.merges, 0u);
    EXPECT_EQ(stats.runsWritten, 0u);
}

// A cursor that stood on an integer key, was taken off it by another cursor's insert into the
// same table, and then inserted that same key: SQLite's cursor still claimed to stand on the key
// and overwrote a cell of a page it had let go. The binding now makes SQLite forget the cursor's
// cell when it takes the cursor off its entry.
TEST(EngineModel, CursorTakenOffItsEntryThenInsertingItsOldKey) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    TestCursor a(engine.get(), root, 1);
    TestCursor b(engine.get(), root, 1);
    std::map<std::int64_t, std::string> model;
    for (std::int64_t k = 0; k < 400; k += 2) {
        ASSERT_EQ(insertInt(a.get(), k, "x"), SQLITE_OK);
        model[k] = "x";
    }
    ASSERT_EQ(seekInt(a.get(), 100), 0);
    ASSERT_EQ(currentIntKey(a.get()), 100);  // SQLite now knows the cursor's key
    // Enough inserts to split the page the cursor stood on.
    for (std::int64_t k = 1; k < 400; k += 2) {
        ASSERT_EQ(insertInt(b.get(), k, std::string(50, 'b')), SQLITE_OK);
        model[k] = std::string(50, 'b');
    }
    ASSERT_EQ(insertInt(a.get(), 100, "new"), SQLITE_OK);
    model[100] = "new";
    auto got = walkInts(a.get());
    std::vector<std::pair<std::int64_t, std::string>> want(model.begin(), model.end());
    EXPECT_TRUE(got == want);
}

// A cursor on the last entry of a key-only table inserted a key that belongs on the same page
// but before the last one: SQLite kept its "on the last entry" mark, and the next Last did not
// move. The binding drops the mark after every insert.
namespace {

// The keys k0000..k1999 in a key-only table, enough for more than one level of pages (so the
// last entry is not on the root), and the cursor on the last one.
void fillAndGoLast(BtCursor* cur) {
    char key[16];
    for (int i = 0; i < 2000; ++i) {
        std::snprintf(key, sizeof key, "k%04d", i);
        ASSERT_EQ(insertBytes(cur, key), SQLITE_OK);
    }
    int res = 1;
    ASSERT_EQ(sqlite3BtreeLast(cur, &res), SQLITE_OK);
    ASSERT_EQ(currentKey(cur), "k1999");
}

}  // namespace

TEST(EngineModel, LastAfterAnInsertBeforeTheLastEntryOfItsPage) {
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kKeyOnlyTable), 1);
    fillAndGoLast(cur.get());
    int res = 1;
    ASSERT_EQ(insertBytes(cur.get(), "k1998a"), SQLITE_OK);
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "k1999");
    ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(cur.get()), "k1998a");
}

// The same with a search: found by the randomised test above (seed 6). A search that starts on
// the cursor's current page (the last one) kept SQLite's "on the last entry" mark wherever it
// landed, and the next Last did not move.
TEST(EngineModel, LastAfterASearchThatStartedOnTheLastPage) {
    TestEngine engine;
    TestCursor cur(engine.get(), engine.createTable(kKeyOnlyTable), 1);
    fillAndGoLast(cur.get());
    int res = 1;
    ASSERT_EQ(seekBytes(cur.get(), "k1997"), 0);
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "k1999");
}
