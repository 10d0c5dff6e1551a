// Model-based randomised test of the store: seeded programs of host actions (store_program.h
// says what they do and what the model checks), every step compared with the model, and
// SQLite's own integrity check of the whole database after each program.
//
// KOV_MODEL_SEEDS=N runs N seeds instead of the default 200.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <string>

#include "pager_test_util.h"
#include "store_program.h"

namespace {

constexpr int kSteps = 300;

// The store's whole interface, table kinds outside the three named ones and key forms that do not
// match a table's kind included; no faults.
kovtest::ProgramOptions modelOptions() {
    kovtest::ProgramOptions o;
    o.oddInputs = true;
    return o;
}

// Runs the program of one seed; a failure names the seed and the first mismatches.
void runSeed(std::uint32_t seed) {
    kovtest::SeededChoices choices(seed);
    kovtest::StoreProgram program(choices, modelOptions());
    program.run(kSteps);
    EXPECT_EQ(program.steps(), static_cast<std::uint64_t>(kSteps)) << "seed " << seed;
    EXPECT_FALSE(program.stopped()) << "seed " << seed;
    EXPECT_EQ(program.mismatches(), 0u) << "seed " << seed;
    EXPECT_EQ(kovtest::storeIntegrityProblems(), "") << "seed " << seed;
    for (const std::string& text : program.mismatchTexts())
        ADD_FAILURE() << "seed " << seed << ": " << text;
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
// search); it stays as a quick check of its own.
TEST(PagerModel, RegressionSeed1SearchWhileOnASearchResult) {
    runSeed(1);
}
