// Temporary-directory resolution, the parts that behave alike on every platform: the strip, the
// cache, explicit directories and the candidate search over lists of fixed and located paths.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <optional>
#include <string>
#include <vector>

#include "scratch_directory.h"
#include "tempdir/StripCharacters.h"
#include "tempdir/TempDirectory.h"
#include "tempdir/TempDirectoryCache.h"
#include "tempdir/TempDirectorySearch.h"

namespace fs = std::filesystem;

namespace {

using kov::stripCharacters;
using kov::StripMode;
using kov::TempDirectoryCandidate;

// A scratch directory of its own for each test, removed afterwards, and a fresh cache.
class TempDirTest : public ::testing::Test {
  protected:
    void SetUp() override {
        kov::tempDirectoryCache().TEST_reset();
        base_ = scratch_.path();
        ASSERT_FALSE(base_.empty()) << "no scratch directory";
    }
    void TearDown() override { kov::tempDirectoryCache().TEST_reset(); }

    // A path under the scratch directory, with forward slashes.
    std::string at(const std::string& relative) const {
        return (base_ / relative).generic_string();
    }
    // The same path in the platform's native form.
    std::string nativeAt(const std::string& relative) const {
        return (base_ / fs::path(relative).make_preferred()).string();
    }
    void makeDirectory(const std::string& relative) const {
        ASSERT_TRUE(fs::create_directories(base_ / relative));
    }
    void makeFile(const std::string& relative) const {
        std::ofstream out(base_ / relative);
        out << "not a directory";
        ASSERT_TRUE(out.good());
    }
    bool isDirectory(const std::string& relative) const {
        return fs::is_directory(base_ / relative);
    }
    bool existsAtAll(const std::string& relative) const {
        std::error_code ignored;
        return fs::exists(base_ / relative, ignored);
    }

    kov::test::ScratchDirectory scratch_{"kov_tempdir_test_"};
    fs::path base_;
};

// ---- stripCharacters ----

TEST(StripCharacters, TrailingRemovesTrailingSeparators) {
    EXPECT_EQ(stripCharacters("abc//", "/\\", StripMode::trailing), "abc");
}

TEST(StripCharacters, TrailingOnOnlySeparatorsGivesEmpty) {
    EXPECT_EQ(stripCharacters("///", "/\\", StripMode::trailing), "");
}

TEST(StripCharacters, LeadingRemovesLeadingSeparators) {
    EXPECT_EQ(stripCharacters("//abc", "/\\", StripMode::leading), "abc");
}

TEST(StripCharacters, EmptyTextIsReturnedUnchanged) {
    EXPECT_EQ(stripCharacters("", "/\\", StripMode::trailing), "");
    EXPECT_EQ(stripCharacters("", "/\\", StripMode::both), "");
}

TEST(StripCharacters, EmptySetReturnsTextUnchanged) {
    EXPECT_EQ(stripCharacters("//abc//", "", StripMode::both), "//abc//");
    EXPECT_EQ(stripCharacters("abc/", "", StripMode::trailing), "abc/");
}

TEST(StripCharacters, ModeChoosesTheEnds) {
    EXPECT_EQ(stripCharacters("/\\a/b\\/", "/\\", StripMode::leading), "a/b\\/");
    EXPECT_EQ(stripCharacters("/\\a/b\\/", "/\\", StripMode::trailing), "/\\a/b");
    EXPECT_EQ(stripCharacters("/\\a/b\\/", "/\\", StripMode::both), "a/b");
}

TEST(StripCharacters, LeadingAndBothOnOnlySetCharactersGiveEmpty) {
    EXPECT_EQ(stripCharacters("/\\/", "/\\", StripMode::leading), "");
    EXPECT_EQ(stripCharacters("/\\/", "/\\", StripMode::both), "");
}

TEST(StripCharacters, TextWithoutSetCharactersAtTheEndsIsUnchanged) {
    EXPECT_EQ(stripCharacters("a//b", "/", StripMode::both), "a//b");
}

TEST(StripCharacters, OnlyTheBytesOfTheSetAreStripped) {
    // The backslash is not in the set: it stays.
    EXPECT_EQ(stripCharacters("dir\\//", "/", StripMode::trailing), "dir\\");
}

TEST(StripCharacters, BytesOutsideAsciiAreKept) {
    // "caf\xc3\xa9" is UTF-8 for a word ending in an accented letter; "\xe9" alone is not UTF-8.
    EXPECT_EQ(stripCharacters("caf\xc3\xa9//", "/", StripMode::trailing), "caf\xc3\xa9");
    EXPECT_EQ(stripCharacters("/\xe9\xff/", "/", StripMode::both), "\xe9\xff");
}

TEST(StripCharacters, ModeValuesAreFixed) {
    EXPECT_EQ(static_cast<int>(StripMode::leading), 1);
    EXPECT_EQ(static_cast<int>(StripMode::trailing), 2);
    EXPECT_EQ(static_cast<int>(StripMode::both), 3);
}

// ---- TempDirectoryCache ----

TEST(TempDirectoryCache, StartsUnpublishedAfterReset) {
    kov::TempDirectoryCache& cache = kov::tempDirectoryCache();
    cache.TEST_reset();
    EXPECT_FALSE(cache.initialised());
    EXPECT_EQ(cache.path(), "");
    EXPECT_EQ(cache.source(), "");
}

TEST(TempDirectoryCache, PublishStoresPathAndSourceAndSetsTheFlag) {
    kov::TempDirectoryCache cache;
    EXPECT_FALSE(cache.initialised());
    cache.publish("/some/dir", "TMP");
    EXPECT_TRUE(cache.initialised());
    EXPECT_EQ(cache.path(), "/some/dir");
    EXPECT_EQ(cache.source(), "TMP");
}

TEST(TempDirectoryCache, LaterPublishWins) {
    kov::TempDirectoryCache cache;
    cache.publish("/first", "KOV_TEMP");
    cache.publish("/second", "");
    EXPECT_TRUE(cache.initialised());
    EXPECT_EQ(cache.path(), "/second");
    EXPECT_EQ(cache.source(), "");
}

// ---- resolveTempDirectory with an explicit directory ----

TEST_F(TempDirTest, ExplicitDirectoryIsTakenUnchangedButForTrailingSeparators) {
    const std::string wanted = at("x") + "/";  // forward slashes, trailing slash, not on disk
    kov::resolveTempDirectory(wanted.c_str());
    kov::TempDirectoryCache& cache = kov::tempDirectoryCache();
    EXPECT_TRUE(cache.initialised());
    EXPECT_EQ(cache.path(), at("x"));
    EXPECT_EQ(cache.source(), "");
    EXPECT_FALSE(existsAtAll("x"));  // nothing tested, nothing created
    EXPECT_EQ(kov::getTempDirectory(), at("x"));
}

TEST_F(TempDirTest, ExplicitDriveStyleDirectoryKeepsForwardSlashes) {
    kov::resolveTempDirectory("D:/x/");
    EXPECT_EQ(kov::getTempDirectory(), "D:/x");
    EXPECT_EQ(kov::tempDirectoryCache().source(), "");
}

TEST_F(TempDirTest, ExplicitDirectoryIsNotConvertedToNativeForm) {
    kov::resolveTempDirectory("a//b");
    EXPECT_EQ(kov::getTempDirectory(), "a//b");
}

TEST_F(TempDirTest, ExplicitDirectoryOfOnlySlashesGivesEmptyText) {
    kov::resolveTempDirectory("///");
    EXPECT_TRUE(kov::tempDirectoryCache().initialised());
    EXPECT_EQ(kov::getTempDirectory(), "");
}

TEST_F(TempDirTest, ExplicitDirectoryReplacesAnEarlierAnswer) {
    kov::resolveTempDirectory("first");
    kov::resolveTempDirectory("second/");
    EXPECT_EQ(kov::getTempDirectory(), "second");
}

TEST_F(TempDirTest, PublishedAnswerIsReturnedWithoutResolvingAgain) {
    // The cache holds a text no search could produce; getTempDirectory hands it back as it is.
    kov::tempDirectoryCache().publish("no search gives this", "TEMP");
    EXPECT_EQ(kov::getTempDirectory(), "no search gives this");
    EXPECT_EQ(kov::getTempDirectory(), "no search gives this");
    EXPECT_EQ(kov::tempDirectoryCache().source(), "TEMP");
}

TEST_F(TempDirTest, FirstCallResolvesAndPublishesAnExistingDirectory) {
    ASSERT_FALSE(kov::tempDirectoryCache().initialised());
    const std::string dir = kov::getTempDirectory();
    EXPECT_TRUE(kov::tempDirectoryCache().initialised());
    EXPECT_FALSE(dir.empty());
    EXPECT_TRUE(fs::is_directory(dir)) << dir;
    EXPECT_EQ(kov::stripCharacters(dir, kov::tempDirectorySeparators(), StripMode::trailing), dir);
    EXPECT_EQ(kov::getTempDirectory(), dir);
}

// ---- the candidate search over lists of its own ----

TEST_F(TempDirTest, SearchOfAnEmptyListGivesNothing) {
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({});
    EXPECT_EQ(found.path, "");
    EXPECT_EQ(found.source, "");
}

TEST_F(TempDirTest, SearchTakesTheFirstExistingDirectory) {
    makeDirectory("b");
    makeDirectory("c");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("a")),
        TempDirectoryCandidate::fixed(at("b")),
        TempDirectoryCandidate::fixed(at("c")),
    });
    EXPECT_EQ(found.path, nativeAt("b"));
    EXPECT_EQ(found.source, "");
    EXPECT_FALSE(existsAtAll("a"));
}

TEST_F(TempDirTest, SearchCreatesOnlyTheLastCandidate) {
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("one")),
        TempDirectoryCandidate::fixed(at("two/deep")),
        TempDirectoryCandidate::fixed(at("three/deeper/still")),
    });
    EXPECT_EQ(found.path, nativeAt("three/deeper/still"));
    EXPECT_TRUE(isDirectory("three/deeper/still"));  // made with its missing parents
    EXPECT_FALSE(existsAtAll("one"));
    EXPECT_FALSE(existsAtAll("two"));
}

TEST_F(TempDirTest, SearchUsesTheLastCandidateEvenWhenItsCreationFails) {
    makeFile("file");
    // A directory cannot be made inside a regular file.
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("missing")),
        TempDirectoryCandidate::fixed(at("file/sub")),
    });
    EXPECT_EQ(found.path, nativeAt("file/sub"));
    EXPECT_EQ(found.source, "");
    EXPECT_FALSE(existsAtAll("file/sub"));
    EXPECT_FALSE(existsAtAll("missing"));
}

TEST_F(TempDirTest, SearchReturnsALastCandidateThatIsARegularFile) {
    // The last candidate is not tested: here it is a regular file, its creation fails, and it is
    // the answer all the same.
    makeFile("plain");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("missing")),
        TempDirectoryCandidate::fixed(at("plain")),
    });
    EXPECT_EQ(found.path, nativeAt("plain"));
    EXPECT_TRUE(fs::is_regular_file(base_ / "plain"));
}

TEST_F(TempDirTest, SearchSkipsARegularFile) {
    makeFile("plain");
    makeDirectory("dir");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("plain")),
        TempDirectoryCandidate::fixed(at("dir")),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(found.path, nativeAt("dir"));
    EXPECT_FALSE(existsAtAll("last"));
}

TEST_F(TempDirTest, SearchGivesTheNativeFormWithoutDoubledOrTrailingSeparators) {
    makeDirectory("scratch/inner");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("scratch") + "//inner/"),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(found.path, nativeAt("scratch/inner"));
}

TEST_F(TempDirTest, SearchUsesALocatedCandidateThatIsFound) {
    makeDirectory("found");
    int calls = 0;
    const std::string where = at("found");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("missing")),
        TempDirectoryCandidate::located("test folder",
                                        [&calls, where]() -> std::optional<std::string> {
                                            ++calls;
                                            return where;
                                        }),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(calls, 1);
    EXPECT_EQ(found.path, nativeAt("found"));
    EXPECT_EQ(found.source, "");
    EXPECT_FALSE(existsAtAll("last"));
}

TEST_F(TempDirTest, SearchSkipsALocatedCandidateThatIsNotFound) {
    makeDirectory("after");
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("missing")),
        TempDirectoryCandidate::located("nowhere", []() { return std::optional<std::string>(); }),
        TempDirectoryCandidate::fixed(at("after")),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(found.path, nativeAt("after"));
    EXPECT_FALSE(existsAtAll("missing"));
}

TEST_F(TempDirTest, SearchDoesNotRunALocatorItNeverReaches) {
    makeDirectory("first");
    int calls = 0;
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("first")),
        TempDirectoryCandidate::located("never",
                                        [&calls]() -> std::optional<std::string> {
                                            ++calls;
                                            return std::string("/");
                                        }),
        TempDirectoryCandidate::fixed(at("last")),
    });
    EXPECT_EQ(calls, 0);
    EXPECT_EQ(found.path, nativeAt("first"));
}

TEST_F(TempDirTest, SearchWithALastLocatedCandidateNotFoundCreatesThePreviousOne) {
    // A located candidate that finds nothing leaves the previous candidate in place; when it is
    // the last, that previous candidate is the one created.
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(at("previous")),
        TempDirectoryCandidate::located("nowhere", []() { return std::optional<std::string>(); }),
    });
    EXPECT_EQ(found.path, nativeAt("previous"));
    EXPECT_TRUE(isDirectory("previous"));
}

}  // namespace
