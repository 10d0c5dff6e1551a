// The store's three classes under the store fuzz target's check (tests/fuzz/store_fuzz.cpp): byte
// programs of every variant, each checked step by step against the model of store_program.h.
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "pager_test_util.h"
#include "store_program.h"

// The store fuzz target's check (tests/fuzz/store_fuzz.cpp) on fixed inputs: byte programs of
// every variant (first byte), with out-of-range kinds, mismatching key forms and pager copies,
// each checked step by step against the model (as long as it can follow), so that the check
// runs in every build; the inputs the fuzzer found follow as regression tests.
TEST(StoreFuzz, StoreByteProgramsMatchTheModel) {
    std::mt19937 gen(2026);
    for (int input = 0; input < 48; ++input) {
        std::vector<std::uint8_t> bytes(200 + static_cast<std::size_t>(input) * 50);
        for (auto& b : bytes)
            b = static_cast<std::uint8_t>(gen());
        bytes[0] = static_cast<std::uint8_t>(input & 15);
        kovtest::ByteChoices choices(bytes.data() + 1, bytes.size() - 1);
        kovtest::StoreProgram program(choices, kovtest::fuzzVariant(bytes[0]));
        program.run(1000);
        EXPECT_GT(program.operations(), 0u);
        EXPECT_EQ(program.mismatches(), 0u) << "input " << input << ": " << program.firstMismatch();
    }
}

// The variants with tiny loads (bit 3 of the first byte): byte programs whose inserts are
// gathered, written out in runs and merged, and whose every step matches the model and its
// account of the engine's load statistics.
TEST(StoreFuzz, TinyLoadByteProgramsWriteRunsAndMerge) {
    std::mt19937 gen(2027);
    kovtest::LoadReport sum;
    for (int input = 0; input < 16; ++input) {
        std::vector<std::uint8_t> bytes(6000);
        for (auto& b : bytes)
            b = static_cast<std::uint8_t>(gen());
        bytes[0] = static_cast<std::uint8_t>(8 | (input & 7));
        kovtest::ByteChoices choices(bytes.data() + 1, bytes.size() - 1);
        kovtest::StoreProgram program(choices, kovtest::fuzzVariant(bytes[0]));
        program.run(1000);
        EXPECT_EQ(program.mismatches(), 0u) << "input " << input << ": " << program.firstMismatch();
        kovtest::addLoads(sum, program.loadReport());
    }
    EXPECT_GT(sum.engine.gathered, 0u);
    EXPECT_GT(sum.engine.runsWritten, 0u);
    EXPECT_GT(sum.engine.merges, 0u);
    EXPECT_GT(sum.statsChecked, 1000u);
}

// An empty program and a program of zeros (every choice the first one) end cleanly.
TEST(StoreFuzz, StoreDegenerateByteProgramsEndCleanly) {
    kovtest::ProgramOptions options;
    options.oddInputs = true;
    {
        kovtest::ByteChoices none(nullptr, 0);
        kovtest::StoreProgram program(none, options);
        program.run(1000);
        EXPECT_EQ(program.mismatches(), 0u);
    }
    const std::vector<std::uint8_t> zeros(4000, 0);
    kovtest::ByteChoices choices(zeros.data(), zeros.size());
    kovtest::StoreProgram program(choices, options);
    program.run(1000);
    EXPECT_GT(program.operations(), 100u);
    EXPECT_EQ(program.mismatches(), 0u) << program.firstMismatch();
}

// Found by the store fuzzer (minimized to 32 bytes; also in the seed corpus): a table, a copy of
// the pager with no cursor, a reader on the table, a second table, the copy assigned back (the
// model stops following), the first table destroyed, a writer on the second, then a table
// creation. The creation reopens every slot and the program took each reopened cursor's
// position by the model's key form: a byte-string key of the size the engine reported, which on
// a table of integer keys at that root is the integer key itself, and the program asked for a
// string of that many bytes. It now reads the key in place, and only from a byte-string table.
// Step by step: the same calls, with an integer key of 2^40 under the writer, and what the reader
// (whose slot the copy's registry gave to the writer) answers after the creation.
TEST(StoreFuzz, RegressionPositionTakenAfterACopyWasAssignedBack) {
    KovPager::instance()->reset();
    auto first = std::make_unique<KovBtree>(KovBtree::BlobTable);
    {
        kovtest::PagerCopy copy;  // no cursor in its registry
        auto reader = std::make_unique<KovBtreeCursor>(*first, false);
        ASSERT_EQ(KovTestAccess::slotIndex(*reader), 0u);
        KovBtree second(KovBtree::IntKeyTable);
        *KovPager::instance() = *copy;  // the reader's slot is gone from the registry
        EXPECT_TRUE(KovTestAccess::slots().empty());
        first.reset();
        KovBtreeCursor writer(second, true);
        ASSERT_EQ(KovTestAccess::slotIndex(writer), 0u);  // the reader's index, now the writer's
        kovtest::insertInt(writer, std::int64_t{1} << 40, "x");
        ASSERT_EQ(writer.seek(std::int64_t{1} << 40), 0);
        KovBtree third(KovBtree::IndexTable);  // reopens the slot on the integer table
        ASSERT_TRUE(reader->good());
        std::string payload = "old";
        EXPECT_FALSE(reader->indexKeyFetch("", 0, payload));  // no byte key to fetch
        EXPECT_EQ(payload, "old");
        EXPECT_TRUE(reader->keyView().empty());
        EXPECT_EQ(kovtest::intKey(writer), std::int64_t{1} << 40);
        reader.reset();  // its slot index is the writer's: the writer's cursor goes with it
    }
    EXPECT_FALSE(KovPager::instance()->failed());
}
