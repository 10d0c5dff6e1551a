// Inputs found by the text-rules fuzz target (tests/fuzz/text_rules_fuzz),
// kept as fixed tests, and the seed corpus run through the same property
// checks, so that the properties are checked in every build, not only in
// fuzz builds.
#include <gtest/gtest.h>

#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "fuzz/text_rules_invariants.h"
#include "store_program.h"
#include "support/NativePath.h"
#include "tempdir/StripCharacters.h"

namespace {

using kov::path::PathStyle;

std::string bytes(const char* data, std::size_t size) {
    return std::string(data, size);
}

}  // namespace

// The first input the fuzzer stopped on (base64 AwIvXC8veFxceS9cL49c): mode
// 3, set "/\", text "//x\\y/\/" 0x8F "\". Its Windows native form keeps a
// doubled backslash in the middle (a run of three becomes two, as each pair
// is replaced by one in a single pass), so a second pass changes it again:
// the Windows form is not idempotent for runs of three or more backslashes,
// and splitting it drops the empty component between the two.
TEST(FuzzRegression, WindowsFormOfALongBackslashRunIsNotIdempotent) {
    const std::string input = bytes("\x03\x02/\\//x\\\\y/\\/\x8f\\", 15);
    EXPECT_EQ(kov::fuzz::checkTextRules(input), "");

    const std::string text = bytes("//x\\\\y/\\/\x8f\\", 11);
    const std::string native = kov::path::nativeForm(text, PathStyle::Windows);
    EXPECT_EQ(native, "\\\\x\\y\\\\\x8f");
    EXPECT_EQ(kov::path::nativeForm(native, PathStyle::Windows), "\\\\x\\y\\\x8f");
    EXPECT_EQ(kov::path::splitNative(native, PathStyle::Windows),
              (std::vector<std::string>{"\\\\", "x", "y", "\x8f"}));
    EXPECT_EQ(kov::path::nativeForm(text, PathStyle::Posix), "/x\\\\y/\\/\x8f\\");
}

// The smallest forms of the same finding.
TEST(FuzzRegression, RunsOfBackslashesHalveOnEachPass) {
    EXPECT_EQ(kov::path::nativeForm("a\\\\\\\\b", PathStyle::Windows), "a\\\\b");
    EXPECT_EQ(kov::path::nativeForm("a\\\\b", PathStyle::Windows), "a\\b");
    EXPECT_EQ(kov::path::nativeForm("\\\\\\x", PathStyle::Windows), "\\\\\\x");
    EXPECT_EQ(kov::path::splitNative("\\\\\\x", PathStyle::Windows),
              (std::vector<std::string>{"\\\\", "x"}));
    EXPECT_EQ(kov::fuzz::checkTextRules(kov::fuzz::encodeTextRules(3, "/", "a\\\\\\\\b")), "");
    EXPECT_EQ(kov::fuzz::checkTextRules(kov::fuzz::encodeTextRules(3, "/", "\\\\\\x\\y")), "");
}

// The property checks themselves notice a broken rule: a form that differs
// from the run-length rule and a strip that leaves a set byte are reported.
TEST(FuzzRegression, PropertyChecksReportBrokenResults) {
    EXPECT_EQ(kov::fuzz::detail::windowsRunModel("a\\\\\\b"), "a\\\\b");
    EXPECT_EQ(kov::fuzz::detail::windowsRunModel("\\\\srv\\share\\"), "\\\\srv\\share");
    EXPECT_EQ(kov::fuzz::detail::windowsRunModel("a//b/"), "a\\b");
    EXPECT_NE(kov::fuzz::detail::windowsRunModel("a\\\\b"), "a\\\\b");
    kov::fuzz::TextRulesInput in;
    in.text = "//a//";
    in.characters = "/";
    in.mode = 3;
    EXPECT_EQ(kov::fuzz::detail::checkStrip(in), "");
    EXPECT_EQ(kov::stripCharacters(in.text, in.characters, kov::StripMode::both), "a");
}

// Mode values outside 1..3: the two low bits choose the ends (5 strips the
// front, 6 the end, 7 both, 4 and 0 nothing).
TEST(FuzzRegression, ModeValuesOutsideTheNamedOnesUseTheirLowBits) {
    const std::string text = "/a/";
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(0)), "/a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(4)), "/a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(5)), "a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(6)), "/a");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(7)), "a");
}

// The seed corpus (tests/fuzz/corpus/text_rules) passes every property.
TEST(FuzzRegression, SeedsKeepEveryProperty) {
    const std::vector<std::string> seeds = {
        kov::fuzz::encodeTextRules(2, "/", "a//b/"),
        kov::fuzz::encodeTextRules(3, "\\", "\\\\srv\\share\\"),
        kov::fuzz::encodeTextRules(2, "/", "///"),
        kov::fuzz::encodeTextRules(1, "\\/", "C:"),
        kov::fuzz::encodeTextRules(3, "\\", "Q:\\"),
        kov::fuzz::encodeTextRules(2, "/", "/"),
        kov::fuzz::encodeTextRules(2, "\\", "\\\\"),
        kov::fuzz::encodeTextRules(1, ".", "."),
        kov::fuzz::encodeTextRules(3, "/", "a\\b"),
        kov::fuzz::encodeTextRules(3, "/\\", "//x\\\\y//z\\"),
        kov::fuzz::encodeTextRules(3, " \t", "  dir name \t"),
        kov::fuzz::encodeTextRules(3, "", "abc/"),
        kov::fuzz::encodeTextRules(2, "/", "d\xc3\xa9j\xc3\xa0/"),
        kov::fuzz::encodeTextRules(7, "/", "/a/"),
        kov::fuzz::encodeTextRules(0, "/", "/a/"),
        std::string(),
        std::string(1, '\x03'),
    };
    for (const std::string& seed : seeds)
        EXPECT_EQ(kov::fuzz::checkTextRules(seed), "") << "seed of " << seed.size() << " bytes";
}

// The store fuzz target's check (tests/fuzz/store_fuzz.cpp) on fixed inputs: byte programs of
// every variant (first byte), with out-of-range kinds, mismatching key forms and pager copies,
// each checked step by step against the model (as long as it can follow). The fuzzer found no
// input that breaks it; these keep the same check in every build.
TEST(FuzzRegression, StoreByteProgramsMatchTheModel) {
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
TEST(FuzzRegression, StoreDegenerateByteProgramsEndCleanly) {
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
