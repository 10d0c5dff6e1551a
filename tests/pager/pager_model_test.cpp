// Model-based randomised test of the store: seeded programs of host actions (store_program.h
// says what they do and what the model checks), every step compared with the model, and
// SQLite's own integrity check of the whole database after each program.
//
// KOV_MODEL_SEEDS=N runs N seeds instead of the default 200.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "pager_test_util.h"
#include "store_program.h"

namespace {

constexpr int kSteps = 300;
// Programs with tiny loads: long enough for runs to pile up between reads.
constexpr int kLoadSteps = 1500;

// The store's whole interface, table kinds outside the three named ones and key forms that do not
// match a table's kind included; no faults.
kovtest::ProgramOptions modelOptions() {
    kovtest::ProgramOptions o;
    o.oddInputs = true;
    return o;
}

// Runs the program of one seed; a failure names the seed and the first mismatches. SQLite's
// integrity check runs on the engine the program leaves open, before the program's end closes
// it; the program's load report is returned.
kovtest::LoadReport runSeed(std::uint32_t seed,
                            const kovtest::ProgramOptions& options = modelOptions(),
                            int steps = kSteps) {
    kovtest::SeededChoices choices(seed);
    kovtest::StoreProgram program(choices, options);
    program.begin();
    for (int i = 0; i < steps && !program.stopped(); ++i)
        program.step();
    EXPECT_EQ(kovtest::storeIntegrityProblems(), "") << "seed " << seed;
    program.end();
    EXPECT_EQ(program.steps(), static_cast<std::uint64_t>(steps)) << "seed " << seed;
    EXPECT_FALSE(program.stopped()) << "seed " << seed;
    EXPECT_EQ(program.mismatches(), 0u) << "seed " << seed;
    for (const std::string& text : program.mismatchTexts())
        ADD_FAILURE() << "seed " << seed << ": " << text;
    return program.loadReport();
}

int seedCount() {
    const char* v = std::getenv("KOV_MODEL_SEEDS");
    if (v != nullptr && std::atoi(v) > 0)
        return std::atoi(v);
    return 200;
}

}  // namespace

TEST(PagerModel, RandomProgramsMatchTheModel) {
    const int seeds = seedCount();
    for (int seed = 1; seed <= seeds; ++seed) {
        runSeed(static_cast<std::uint32_t>(seed));
        if (::testing::Test::HasFailure()) {
            ADD_FAILURE() << "first failing seed: " << seed;
            return;
        }
    }
}

// Programs that also copy the pager, assign copies back and reset through them: the model
// follows until the first such assignment or reset, and from then on the programs only drive
// the store (the sanitizer pass watches them).
TEST(PagerModel, RandomProgramsWithPagerCopiesRunClean) {
    const int seeds = seedCount() / 2;
    for (int seed = 1; seed <= seeds; ++seed) {
        kovtest::ProgramOptions options = modelOptions();
        options.pagerCopies = true;
        kovtest::SeededChoices choices(static_cast<std::uint32_t>(seed));
        kovtest::StoreProgram program(choices, options);
        program.run(kSteps);
        EXPECT_EQ(program.steps(), static_cast<std::uint64_t>(kSteps)) << "seed " << seed;
        EXPECT_EQ(program.mismatches(), 0u) << "seed " << seed << ": " << program.firstMismatch();
        if (::testing::Test::HasFailure())
            return;
    }
}

// A program of seed 1 was the first to find the engine answering a second search on a cursor
// with a refusal instead of a position (a search while the cursor stood on a row of the same
// search). Step by step, on each kind of table: a search, the same search from where it left the
// cursor, a search for a key between two (landing on the larger), the same again, and an insert
// of that key through the cursor the search left next to its place.
TEST(PagerModel, RegressionSeed1SearchWhileOnASearchResult) {
    KovPager::instance()->reset();
    {
        KovBtree table(KovBtree::IntKeyTable);
        KovBtreeCursor c(table, true);
        for (std::int64_t k : {10, 20, 30})
            kovtest::insertInt(c, k, "d" + std::to_string(k));
        for (int again = 0; again < 2; ++again) {
            EXPECT_EQ(c.seek(std::int64_t{20}), 0) << again;
            ASSERT_TRUE(c.good());
            EXPECT_EQ(kovtest::intKey(c), 20);
        }
        for (int again = 0; again < 2; ++again) {
            EXPECT_GT(c.seek(std::int64_t{15}), 0) << again;
            ASSERT_TRUE(c.good());
            EXPECT_EQ(kovtest::intKey(c), 20);
        }
        kovtest::insertInt(c, 15, "d15");
        std::vector<std::int64_t> keys;
        for (const auto& row : kovtest::walkInts(c))
            keys.push_back(row.first);
        EXPECT_EQ(keys, (std::vector<std::int64_t>{10, 15, 20, 30}));
    }
    for (KovBtree::TableType kind : {KovBtree::BlobTable, KovBtree::IndexTable}) {
        KovBtree table(kind);
        KovBtreeCursor c(table, true);
        for (const char* k : {"b", "d", "f"})
            kovtest::insertBytes(c, k, "data");
        for (int again = 0; again < 2; ++again) {
            EXPECT_EQ(kovtest::seekBytes(c, "d"), 0) << again;
            ASSERT_TRUE(c.good());
            EXPECT_EQ(kovtest::byteKey(c), "d");
        }
        for (int again = 0; again < 2; ++again) {
            EXPECT_GT(kovtest::seekBytes(c, "c"), 0) << again;
            ASSERT_TRUE(c.good());
            EXPECT_EQ(kovtest::byteKey(c), "d");
        }
        kovtest::insertBytes(c, "c", "data");
        std::vector<std::string> keys;
        for (const auto& row : kovtest::walkBytes(c))
            keys.push_back(row.first);
        EXPECT_EQ(keys, (std::vector<std::string>{"b", "c", "d", "f"})) << kind;
    }
}

// Tiny loads (a buffer of about 1 KiB, gathered from the second insert after a read): inserts are
// gathered, written out in runs and merged, by appending and by inserts in key order, between
// the reads of every kind. Every step matches the model, whose own account of the loads (which
// insert is gathered, which buffer is written out, appended or merged) matches the engine's
// statistics after every step, and SQLite's integrity check passes after every program. Summed
// over the programs, every path was taken: runs written, merges by appending and by inserts,
// merges of runs sharing a key, reads between inserts, and a table created, a reset made and a
// table destroyed while entries were gathered and not merged.
TEST(PagerModel, TinyLoadsRunAndMergeAsTheModelSays) {
    kovtest::ProgramOptions options = modelOptions();
    options.loads = kov::engine::test::kTinyLoads;
    options.readerPercent = 5;
    kovtest::LoadReport sum;
    const int seeds = seedCount() < 40 ? 40 : seedCount();
    for (int seed = 1; seed <= seeds; ++seed) {
        // Long stretches of inserts between reads (runs, and runs sharing keys), and few cursors
        // (a table destroyed with no cursor open, while it holds gathered entries).
        options.insertPercent = seed % 3 == 0 ? 85 : 60;
        options.maxCursors = seed % 3 == 0 ? 10 : seed % 3;
        const kovtest::LoadReport r =
            runSeed(static_cast<std::uint32_t>(seed), options, kLoadSteps);
        if (::testing::Test::HasFailure()) {
            ADD_FAILURE() << "first failing seed: " << seed;
            return;
        }
        kovtest::addLoads(sum, r);
    }
    std::printf("%d programs: gathered %llu, runs %llu, merges %llu (by appending %llu, by inserts "
                "%llu, over equal keys %llu), reads between inserts %llu, created / reset / "
                "destroyed with entries gathered %llu / %llu / %llu, ambiguous spills %llu, steps "
                "whose statistics matched %llu\n",
                seeds, static_cast<unsigned long long>(sum.engine.gathered),
                static_cast<unsigned long long>(sum.engine.runsWritten),
                static_cast<unsigned long long>(sum.engine.merges),
                static_cast<unsigned long long>(sum.engine.mergedByAppend),
                static_cast<unsigned long long>(sum.mergesByInserts),
                static_cast<unsigned long long>(sum.mergesOverEqualKeys),
                static_cast<unsigned long long>(sum.readsBetweenInserts),
                static_cast<unsigned long long>(sum.createdWithPending),
                static_cast<unsigned long long>(sum.resetsWithPending),
                static_cast<unsigned long long>(sum.destroyedWithPending),
                static_cast<unsigned long long>(sum.ambiguousSpills),
                static_cast<unsigned long long>(sum.statsChecked));
    EXPECT_GT(sum.engine.gathered, 0u);
    EXPECT_GT(sum.engine.runsWritten, 0u);
    EXPECT_GT(sum.engine.merges, 0u);
    EXPECT_GT(sum.engine.mergedByAppend, 0u);
    EXPECT_GT(sum.mergesByInserts, 0u);
    EXPECT_GT(sum.mergesOverEqualKeys, 0u);
    EXPECT_GT(sum.readsBetweenInserts, 0u);
    EXPECT_GT(sum.createdWithPending, 0u);
    EXPECT_GT(sum.resetsWithPending, 0u);
    EXPECT_GT(sum.destroyedWithPending, 0u);
    EXPECT_GT(sum.statsChecked, static_cast<std::uint64_t>(seeds) * kLoadSteps / 2);
}
