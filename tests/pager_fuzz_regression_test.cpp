// The store's three classes under the store fuzz target's check (tests/fuzz/store_fuzz.cpp): byte
// programs of every variant, each checked step by step against the model of store_program.h.
#include <gtest/gtest.h>

#include <cstdint>
#include <random>
#include <vector>

#include "store_program.h"

// The store fuzz target's check (tests/fuzz/store_fuzz.cpp) on fixed inputs: byte programs of
// every variant (first byte), with out-of-range kinds, mismatching key forms and pager copies,
// each checked step by step against the model (as long as it can follow). The fuzzer found no
// input that breaks it; these keep the same check in every build.
TEST(StoreFuzz, StoreByteProgramsMatchTheModel) {
    std::mt19937 gen(2026);
    for (int input = 0; input < 40; ++input) {
        std::vector<std::uint8_t> bytes(200 + static_cast<std::size_t>(input) * 50);
        for (auto& b : bytes)
            b = static_cast<std::uint8_t>(gen());
        bytes[0] = static_cast<std::uint8_t>(input & 7);
        kovtest::ByteChoices choices(bytes.data() + 1, bytes.size() - 1);
        kovtest::StoreProgram program(choices, kovtest::fuzzVariant(bytes[0]));
        program.run(1000);
        EXPECT_GT(program.operations(), 0u);
        EXPECT_EQ(program.mismatches(), 0u) << "input " << input << ": " << program.firstMismatch();
    }
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
