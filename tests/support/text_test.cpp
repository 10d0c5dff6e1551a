// The text utility: UTF-8 / UTF-16 conversion, strict and lossy, and case
// folding.
#include <gtest/gtest.h>

#include <string>

#include "support/Text.h"

namespace {

using kov::text::Utf8Text;

TEST(Text, Utf8RoundTripsThroughUtf16) {
    const std::string text = "a\xC3\xA9\xE2\x82\xAC\xF0\x9F\x98\x80z";  // a é € 😀 z
    std::u16string wide;
    ASSERT_TRUE(kov::text::utf8ToUtf16(text, wide));
    EXPECT_EQ(wide, (std::u16string{u'a', 0x00E9, 0x20AC, 0xD83D, 0xDE00, u'z'}));
    std::string back;
    ASSERT_TRUE(kov::text::utf16ToUtf8(wide, back));
    EXPECT_EQ(back, text);
}

TEST(Text, StrictConversionRefusesMalformedUtf8) {
    std::u16string wide;
    EXPECT_FALSE(kov::text::utf8ToUtf16("ab\xFF", wide));
    EXPECT_FALSE(kov::text::utf8ToUtf16("\xC0\xAF", wide));          // overlong "/"
    EXPECT_FALSE(kov::text::utf8ToUtf16("\xED\xA0\x80", wide));      // surrogate
    EXPECT_FALSE(kov::text::utf8ToUtf16("\xF4\x90\x80\x80", wide));  // past U+10FFFF
    EXPECT_FALSE(kov::text::utf8ToUtf16("\xE2\x82", wide));          // truncated
}

TEST(Text, LossyConversionReplacesEachBadByte) {
    EXPECT_EQ(kov::text::utf8ToUtf16Lossy("a\xFF\xFE"
                                          "b"),
              (std::u16string{u'a', 0xFFFD, 0xFFFD, u'b'}));
    const std::u16string lone{u'x', 0xD800, u'y'};
    std::string out;
    EXPECT_FALSE(kov::text::utf16ToUtf8(lone, out));
    EXPECT_EQ(kov::text::utf16ToUtf8Lossy(lone), "x\xEF\xBF\xBDy");
}

TEST(Text, ValidityCheck) {
    EXPECT_TRUE(kov::text::isValidUtf8(""));
    EXPECT_TRUE(kov::text::isValidUtf8("plain \xD0\x96"));
    EXPECT_FALSE(kov::text::isValidUtf8("\x80"));
}

TEST(Text, FoldsAsciiLatinGreekAndCyrillic) {
    EXPECT_EQ(kov::text::foldCase("ReadMe.TXT"), "readme.txt");
    EXPECT_EQ(kov::text::foldCase("\xC3\x89T\xC3\x89"), "\xC3\xA9t\xC3\xA9");  // ÉTÉ
    EXPECT_EQ(kov::text::foldCase("\xCE\xA3"), "\xCF\x83");                    // Σ -> σ
    EXPECT_EQ(kov::text::foldCase("\xD0\x96"), "\xD0\xB6");                    // Ж -> ж
    EXPECT_EQ(kov::text::foldCase("\xC3\x97"), "\xC3\x97");                    // × stays
}

// Capital I with dot above (U+0130) has no simple folding: it stays, and is
// not equal to the dotless small i (U+0131) that the Latin Extended-A
// pairing would give; its neighbours still pair.
TEST(Text, CapitalIWithDotAboveIsNotFolded) {
    EXPECT_EQ(kov::text::foldCase("\xC4\xB0"), "\xC4\xB0");
    EXPECT_FALSE(kov::text::equalsIgnoringCase("\xC4\xB0", "\xC4\xB1"));
    EXPECT_EQ(kov::text::foldCase("\xC4\xAE"), "\xC4\xAF");  // U+012E -> U+012F
    EXPECT_EQ(kov::text::foldCase("\xC4\xB2"), "\xC4\xB3");  // U+0132 -> U+0133
}

TEST(Text, FoldingKeepsBytesThatAreNotUtf8) {
    EXPECT_EQ(kov::text::foldCase("A\xFF"
                                  "B"),
              "a\xFF"
              "b");
    EXPECT_TRUE(kov::text::equalsIgnoringCase("X\xFE", "x\xFE"));
    EXPECT_FALSE(kov::text::equalsIgnoringCase("X\xFE", "x\xFD"));
}

TEST(Text, EqualityIgnoringCase) {
    EXPECT_TRUE(kov::text::equalsIgnoringCase("Temp", "tEMP"));
    EXPECT_FALSE(kov::text::equalsIgnoringCase("Temp", "Tmp"));
    EXPECT_FALSE(kov::text::equalsIgnoringCase("a", "a "));
}

TEST(Text, Utf8TextIsAValue) {
    const Utf8Text a(std::string("x/y"));
    Utf8Text b = a;
    EXPECT_EQ(a, b);
    EXPECT_EQ(b.size(), 3u);
    EXPECT_FALSE(b.empty());
    EXPECT_TRUE(Utf8Text().empty());
    EXPECT_NE(a, Utf8Text(std::string("x")));
}

TEST(Text, AsciiNarrowTextRoundTrips) {
    // ASCII is the same in every ANSI code page and in UTF-8.
    std::string utf8;
    ASSERT_TRUE(kov::text::narrowToUtf8("c:/temp", utf8));
    EXPECT_EQ(utf8, "c:/temp");
    std::string narrow;
    ASSERT_TRUE(kov::text::utf8ToNarrow(utf8, narrow));
    EXPECT_EQ(narrow, "c:/temp");
    EXPECT_EQ(kov::text::utf8ToNarrowLossy("abc"), "abc");
    EXPECT_EQ(kov::text::narrowToUtf8Lossy("abc"), "abc");
}

}  // namespace
