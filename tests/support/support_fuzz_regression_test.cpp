// The path text rules (support/NativePath) and stripCharacters under the
// text-rules fuzz target's property checks (tests/fuzz/text_rules_fuzz): the
// inputs it found, kept as fixed tests, and its seed corpus, so that the
// properties are checked in every build, not only in fuzz builds.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

#include "text_rules_invariants.h"
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
TEST(TextRulesFuzz, WindowsFormOfALongBackslashRunIsNotIdempotent) {
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
TEST(TextRulesFuzz, RunsOfBackslashesHalveOnEachPass) {
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
TEST(TextRulesFuzz, PropertyChecksReportBrokenResults) {
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
TEST(TextRulesFuzz, ModeValuesOutsideTheNamedOnesUseTheirLowBits) {
    const std::string text = "/a/";
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(0)), "/a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(4)), "/a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(5)), "a/");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(6)), "/a");
    EXPECT_EQ(kov::stripCharacters(text, "/", static_cast<kov::StripMode>(7)), "a");
}

// The seed corpus (tests/fuzz/corpus/text_rules) passes every property.
TEST(TextRulesFuzz, SeedsKeepEveryProperty) {
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
