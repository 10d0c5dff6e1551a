// Narrow text on Windows is the ANSI code page: the conversions to and from UTF-8, strict and
// lossy, and the narrow path form of the file objects, which takes the lossy way. The byte
// values are those of code page 1252 (Western European, Wine's choice for an English or C
// locale); under another ANSI code page only the tests that hold for every code page run.
#include "support/Win32Api.h"

#include <gtest/gtest.h>

#include <string>

#include "support/KovDirectory.h"
#include "support/KovFile.h"
#include "support/Text.h"

namespace {

// U+1F600, a character no single- or double-byte ANSI code page holds.
const char* const kOutsideEveryCodePage = "\xF0\x9F\x98\x80";

bool westernCodePage() {
    return GetACP() == 1252;
}

TEST(TextWin32, NarrowTextIsTheAnsiCodePage) {
    if (!westernCodePage())
        GTEST_SKIP() << "ANSI code page " << GetACP() << ", not 1252";
    std::string utf8;
    ASSERT_TRUE(kov::text::narrowToUtf8("caf\xE9 \x80", utf8));  // "café €" in 1252
    EXPECT_EQ(utf8, "caf\xC3\xA9 \xE2\x82\xAC");
    std::string narrow;
    ASSERT_TRUE(kov::text::utf8ToNarrow(utf8, narrow));
    EXPECT_EQ(narrow, "caf\xE9 \x80");
    EXPECT_EQ(kov::text::narrowToUtf8Lossy("\xE9"), "\xC3\xA9");
    EXPECT_EQ(kov::text::utf8ToNarrowLossy("\xC3\xA9"), "\xE9");
}

TEST(TextWin32, StrictConversionRefusesWhatTheCodePageCannotHold) {
    std::string narrow = "untouched";
    EXPECT_FALSE(kov::text::utf8ToNarrow(std::string("a") + kOutsideEveryCodePage, narrow));
    if (westernCodePage()) {
        EXPECT_FALSE(kov::text::utf8ToNarrow("\xCE\xA9", narrow));  // Greek capital omega
    }
}

TEST(TextWin32, LossyConversionPutsTheDefaultCharacterInItsPlace) {
    const std::string lossy =
        kov::text::utf8ToNarrowLossy(std::string("a") + kOutsideEveryCodePage + "b");
    ASSERT_GE(lossy.size(), 3u);
    EXPECT_EQ(lossy.front(), 'a');
    EXPECT_EQ(lossy.back(), 'b');
    EXPECT_EQ(lossy.substr(1, lossy.size() - 2).find_first_not_of('?'), std::string::npos) << lossy;
    if (westernCodePage()) {
        EXPECT_EQ(kov::text::utf8ToNarrowLossy("x\xCE\xA9y"), "x?y");
    }
    // Malformed UTF-8 is replaced too rather than refused.
    EXPECT_EQ(kov::text::utf8ToNarrowLossy("ok\xFF").substr(0, 2), "ok");
}

TEST(TextWin32, NarrowPathFormIsLossyAndTheUtf8FormKeepsTheName) {
    if (!westernCodePage())
        GTEST_SKIP() << "ANSI code page " << GetACP() << ", not 1252";
    lumo::ex::KovDirectory dir(std::string("c:/caf\xE9/x"), 1, false);
    EXPECT_EQ(dir.path(2), "c:\\caf\xE9\\x");
    EXPECT_EQ(dir.pathText(2).bytes(), "c:\\caf\xC3\xA9\\x");

    // A name the code page cannot hold is given in UTF-8 and comes out narrow with '?'.
    lumo::ex::KovFile file(kov::text::Utf8Text(std::string("c:/\xCE\xA9.txt")));
    EXPECT_EQ(file.path(2), "c:\\?.txt");
    EXPECT_EQ(file.pathText(2).bytes(), "c:\\\xCE\xA9.txt");
}

}  // namespace
