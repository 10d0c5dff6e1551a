// Temporary-directory resolution on POSIX: the environment variables, the fixed list
// (KOV_TEMP, TEMP, TMP, TMPDIR, /var/tmp, /tmp) and the handling of odd environment values.
//
// Each test starts with a fresh cache and with the four variables unset, and puts them back
// afterwards. The environment is changed under the module's environment lock held exclusively.
#include <gtest/gtest.h>

#include <stdlib.h>
#include <sys/stat.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <vector>

#include "tempdir/StripCharacters.h"
#include "tempdir/TempDirectory.h"
#include "tempdir/TempDirectoryCache.h"
#include "tempdir/TempDirectorySearch.h"
#include "tempdir_test_util.h"

namespace {

using kov::TempDirectoryCandidate;

using kov::test::setVariable;
using kov::test::unsetVariable;

bool isDirectory(const std::string& path) {
    struct stat status;
    return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool existsAtAll(const std::string& path) {
    struct stat status;
    return ::lstat(path.c_str(), &status) == 0;
}

using TempDirPosixTest = kov::test::TempDirEnvironmentTest;

// ---- the fixed list ----

TEST(TempDirPosixCandidates, FixedListInOrder) {
    const std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    const TempDirectoryCandidate::Kind variable = TempDirectoryCandidate::Kind::variable;
    const TempDirectoryCandidate::Kind fixed = TempDirectoryCandidate::Kind::fixed;
    EXPECT_EQ(list[0].kind, variable);
    EXPECT_EQ(list[0].text, "KOV_TEMP");
    EXPECT_EQ(list[1].kind, variable);
    EXPECT_EQ(list[1].text, "TEMP");
    EXPECT_EQ(list[2].kind, variable);
    EXPECT_EQ(list[2].text, "TMP");
    EXPECT_EQ(list[3].kind, variable);
    EXPECT_EQ(list[3].text, "TMPDIR");
    EXPECT_EQ(list[4].kind, fixed);
    EXPECT_EQ(list[4].text, "/var/tmp");
    EXPECT_EQ(list[5].kind, fixed);
    EXPECT_EQ(list[5].text, "/tmp");
}

TEST(TempDirPosixCandidates, OnlyTheSlashIsASeparator) {
    EXPECT_EQ(kov::tempDirectorySeparators(), "/");
}

// ---- getEnvironmentVariable ----

TEST_F(TempDirPosixTest, EnvironmentLookupGivesTheValue) {
    setVariable("TEMP", "/some/value");
    EXPECT_EQ(kov::getEnvironmentVariable("TEMP"), "/some/value");
}

TEST_F(TempDirPosixTest, EnvironmentLookupOfUnsetOrEmptyGivesEmpty) {
    EXPECT_EQ(kov::getEnvironmentVariable("TEMP"), "");
    setVariable("TEMP", "");
    EXPECT_EQ(kov::getEnvironmentVariable("TEMP"), "");
}

// ---- the environment variables, in order ----

TEST_F(TempDirPosixTest, KovTempWinsAndIsTheSource) {
    const std::string kov = makeDirectory("kov");
    setVariable("KOV_TEMP", kov);
    setVariable("TEMP", makeDirectory("temp"));
    setVariable("TMP", makeDirectory("tmp"));
    setVariable("TMPDIR", makeDirectory("tmpdir"));
    EXPECT_EQ(kov::getTempDirectory(), kov);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirPosixTest, KovTempNamingARegularFileIsSkipped) {
    const std::string file = makeFile("plain");
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", file);
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
    EXPECT_TRUE(std::filesystem::is_regular_file(file));  // left as it was
}

TEST_F(TempDirPosixTest, KovTempNamingAMissingDirectoryIsSkippedAndNotCreated) {
    const std::string missing = at("missing/deeper");
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", missing);
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
    EXPECT_FALSE(existsAtAll(at("missing")));
}

TEST_F(TempDirPosixTest, TmpWinsWhenKovTempAndTempAreUnset) {
    const std::string tmp = makeDirectory("tmp");
    setVariable("TMP", tmp);
    setVariable("TMPDIR", makeDirectory("tmpdir"));
    EXPECT_EQ(kov::getTempDirectory(), tmp);
    EXPECT_EQ(source(), "TMP");
}

TEST_F(TempDirPosixTest, TmpdirWinsWhenTheOthersAreUnusable) {
    const std::string tmpdir = makeDirectory("tmpdir");
    setVariable("KOV_TEMP", at("gone"));
    setVariable("TEMP", makeFile("file"));
    setVariable("TMPDIR", tmpdir);
    EXPECT_EQ(kov::getTempDirectory(), tmpdir);
    EXPECT_EQ(source(), "TMPDIR");
    EXPECT_FALSE(existsAtAll(at("gone")));
}

TEST_F(TempDirPosixTest, DoubledAndTrailingSeparatorsComeBackInNativeForm) {
    const std::string scratch = makeDirectory("scratch/inner");
    setVariable("KOV_TEMP", base_ + "//scratch///inner/");
    EXPECT_EQ(kov::getTempDirectory(), scratch);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirPosixTest, SecondCallReturnsTheFirstAnswerAfterTheEnvironmentChanged) {
    const std::string first = makeDirectory("first");
    const std::string second = makeDirectory("second");
    setVariable("KOV_TEMP", first);
    ASSERT_EQ(kov::getTempDirectory(), first);
    setVariable("KOV_TEMP", second);
    setVariable("TEMP", second);
    EXPECT_EQ(kov::getTempDirectory(), first);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirPosixTest, SecondCallDoesNotNoticeTheDirectoryVanishing) {
    const std::string first = makeDirectory("first");
    setVariable("KOV_TEMP", first);
    ASSERT_EQ(kov::getTempDirectory(), first);
    removeTree(first);
    EXPECT_EQ(kov::getTempDirectory(), first);
    EXPECT_FALSE(existsAtAll(first));  // nothing checked it again, nothing made it again
}

TEST_F(TempDirPosixTest, NoUsableVariableFallsBackToVarTmpThenTmp) {
    setVariable("KOV_TEMP", at("missing"));
    const std::string expected = isDirectory("/var/tmp") ? "/var/tmp" : "/tmp";
    EXPECT_EQ(kov::getTempDirectory(), expected);
    EXPECT_EQ(source(), "");
    EXPECT_TRUE(isDirectory(expected));
    EXPECT_FALSE(existsAtAll(at("missing")));
}

TEST_F(TempDirPosixTest, ASingleDotIsPublishedAsADot) {
    setVariable("KOV_TEMP", ".");
    EXPECT_EQ(kov::getTempDirectory(), ".");
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirPosixTest, NonAsciiNameComesBackAsTheSameBytes) {
    const std::string utf8 = makeDirectory("t\xc3\xa9mp");  // UTF-8 e with an acute accent
    setVariable("KOV_TEMP", utf8);
    EXPECT_EQ(kov::getTempDirectory(), utf8);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirPosixTest, BackslashIsAnOrdinaryNameCharacter) {
    // A directory whose name ends in a backslash keeps it: stripping it would name another one.
    const std::string odd = makeDirectory("odd\\");
    setVariable("KOV_TEMP", odd);
    EXPECT_EQ(kov::getTempDirectory(), odd);
}

// ---- odd environment values ----

TEST_F(TempDirPosixTest, EmptyValueIsSkipped) {
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", "");
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
}

TEST_F(TempDirPosixTest, VeryLongValueIsSkipped) {
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", at(std::string(10000, 'a')));
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
}

TEST_F(TempDirPosixTest, VeryLongValueOfManyComponentsIsSkipped) {
    std::string deep = base_;
    while (deep.size() < 10000) {
        deep += "/abcdefgh";
    }
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", deep);
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
    EXPECT_FALSE(existsAtAll(at("abcdefgh")));
}

TEST_F(TempDirPosixTest, OnlySeparatorsValueIsSkipped) {
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", "///");
    setVariable("TEMP", "/");
    setVariable("TMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TMP");
}

TEST_F(TempDirPosixTest, NonUtf8ValueNamingNothingIsSkipped) {
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", at("\xff\xfe\x80-missing"));
    setVariable("TEMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TEMP");
    EXPECT_FALSE(existsAtAll(at("\xff\xfe\x80-missing")));
}

TEST_F(TempDirPosixTest, NonUtf8ValueNamingADirectoryComesBackByteForByte) {
    const std::string odd = makeDirectory("\xff\xfe\x80-dir");
    setVariable("KOV_TEMP", odd);
    EXPECT_EQ(kov::getTempDirectory(), odd);
    EXPECT_EQ(source(), "KOV_TEMP");
}

// ---- the search over lists with variables ----

TEST_F(TempDirPosixTest, SearchCreatesOnlyTheLastCandidateReached) {
    setVariable("KOV_TEMP", at("named/but/missing"));
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::variable("KOV_TEMP"),
        TempDirectoryCandidate::variable("TEMP"),
        TempDirectoryCandidate::fixed(at("fixed")),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(found.path, at("last"));
    EXPECT_EQ(found.source, "");
    EXPECT_TRUE(isDirectory(at("last")));
    EXPECT_FALSE(existsAtAll(at("named")));
    EXPECT_FALSE(existsAtAll(at("fixed")));
}

TEST_F(TempDirPosixTest, SearchCreatesALastVariableCandidateAndNamesItsSource) {
    setVariable("TMP", at("made/here"));
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("missing")),
        TempDirectoryCandidate::variable("TMP"),
    });
    EXPECT_EQ(found.path, at("made/here"));
    EXPECT_EQ(found.source, "TMP");
    EXPECT_TRUE(isDirectory(at("made/here")));
}

TEST_F(TempDirPosixTest, SearchUsesTheLastCandidateEvenWhenItsCreationFails) {
    const std::string file = makeFile("file");
    setVariable("TEMP", file + "/sub/");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::variable("KOV_TEMP"),
        TempDirectoryCandidate::variable("TEMP"),
    });
    EXPECT_EQ(found.path, file + "/sub");
    EXPECT_EQ(found.source, "TEMP");
    EXPECT_FALSE(existsAtAll(file + "/sub"));
}

TEST_F(TempDirPosixTest, ResolutionStripsAndPublishesTheSearchResult) {
    const std::string temp = makeDirectory("temp");
    setVariable("TEMP", temp + "/");
    kov::resolveTempDirectory(nullptr);
    EXPECT_TRUE(kov::tempDirectoryCache().initialised());
    EXPECT_EQ(kov::tempDirectoryCache().path(), temp);
    EXPECT_EQ(source(), "TEMP");
}

}  // namespace
