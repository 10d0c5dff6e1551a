// Temporary-directory resolution on Windows: %KOV_TEMP%, %TEMP%, %TMP%, the local application-data
// folder + "/Temp", "c:/temp", "c:/tmp"; bare drives, native form with backslashes.
//
// Each test starts with a fresh cache and with the three variables unset, and puts them back
// afterwards. The environment is changed under the module's environment lock held exclusively.
#include <gtest/gtest.h>

// Win32Api.h first: shlobj.h needs the types of windows.h.
#include "support/Win32Api.h"

#include <shlobj.h>
#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <optional>
#include <random>
#include <shared_mutex>
#include <string>
#include <vector>

#include "tempdir/TempDirectory.h"
#include "tempdir/TempDirectoryCache.h"
#include "tempdir/TempDirectorySearch.h"
#include "tempdir_test_util.h"

namespace fs = std::filesystem;

namespace {

using kov::TempDirectoryCandidate;

using kov::test::setVariable;
using kov::test::unsetVariable;

bool isDirectory(const std::string& path) {
    const DWORD attributes = ::GetFileAttributesA(path.c_str());
    return attributes != INVALID_FILE_ATTRIBUTES && (attributes & FILE_ATTRIBUTE_DIRECTORY) != 0;
}

bool existsAtAll(const std::string& path) {
    return ::GetFileAttributesA(path.c_str()) != INVALID_FILE_ATTRIBUTES;
}

std::string forwardSlashes(std::string path) {
    for (char& c : path) {
        if (c == '\\') {
            c = '/';
        }
    }
    return path;
}

// A drive letter with no drive behind it, or 'Q' when every letter is taken.
char absentDrive() {
    const DWORD drives = ::GetLogicalDrives();
    for (char letter = 'Q'; letter <= 'Z'; ++letter) {
        if ((drives & (1u << (letter - 'A'))) == 0) {
            return letter;
        }
    }
    return 'Q';
}

using TempDirWin32Test = kov::test::TempDirEnvironmentTest;

// ---- the fixed list ----

TEST(TempDirWin32Candidates, FixedListInOrder) {
    const std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    EXPECT_EQ(list[0].kind, TempDirectoryCandidate::Kind::variable);
    EXPECT_EQ(list[0].text, "KOV_TEMP");
    EXPECT_EQ(list[1].kind, TempDirectoryCandidate::Kind::variable);
    EXPECT_EQ(list[1].text, "TEMP");
    EXPECT_EQ(list[2].kind, TempDirectoryCandidate::Kind::variable);
    EXPECT_EQ(list[2].text, "TMP");
    EXPECT_EQ(list[3].kind, TempDirectoryCandidate::Kind::located);
    EXPECT_EQ(list[4].kind, TempDirectoryCandidate::Kind::fixed);
    EXPECT_EQ(list[4].text, "c:/temp");
    EXPECT_EQ(list[5].kind, TempDirectoryCandidate::Kind::fixed);
    EXPECT_EQ(list[5].text, "c:/tmp");
}

TEST(TempDirWin32Candidates, SlashAndBackslashAreSeparators) {
    EXPECT_EQ(kov::tempDirectorySeparators(), "/\\");
}

TEST(TempDirWin32Candidates, LocalAppDataCandidateIsTheShellFolderPlusTemp) {
    char folder[MAX_PATH] = {};
    ASSERT_EQ(::SHGetFolderPathA(nullptr, CSIDL_LOCAL_APPDATA, nullptr, SHGFP_TYPE_CURRENT, folder),
              S_OK);
    const std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    ASSERT_TRUE(static_cast<bool>(list[3].locate));
    const std::optional<std::string> located = list[3].locate();
    ASSERT_TRUE(located.has_value());
    EXPECT_EQ(*located, std::string(folder) + "/Temp");
}

// ---- the environment variables ----

TEST_F(TempDirWin32Test, KovTempWinsAndIsTheSource) {
    const std::string kov = makeDirectory("kov");
    setVariable("KOV_TEMP", kov);
    setVariable("TEMP", makeDirectory("temp"));
    setVariable("TMP", makeDirectory("tmp"));
    EXPECT_EQ(kov::getTempDirectory(), kov);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirWin32Test, KovTempNamingAFileOrAMissingDirectoryIsSkipped) {
    const std::string temp = makeDirectory("temp");
    setVariable("KOV_TEMP", makeFile("plain"));
    setVariable("TEMP", at("missing"));
    setVariable("TMP", temp);
    EXPECT_EQ(kov::getTempDirectory(), temp);
    EXPECT_EQ(source(), "TMP");
    EXPECT_FALSE(existsAtAll(at("missing")));
}

TEST_F(TempDirWin32Test, ForwardSlashesAndATrailingSlashComeBackWithBackslashes) {
    // D:/scratch/ gives D:\scratch; here on the scratch directory's own drive.
    const std::string scratch = makeDirectory("scratch");
    setVariable("KOV_TEMP", forwardSlashes(scratch) + "/");
    EXPECT_EQ(kov::getTempDirectory(), scratch);
    EXPECT_EQ(source(), "KOV_TEMP");
}

// The value D:/scratch/ itself, where there is a drive D: (the Wine prefix of the cross build
// maps one); the directory is made for the test when it is missing and removed again after.
TEST_F(TempDirWin32Test, DriveDScratchWithForwardSlashesComesBackAsDScratch) {
    const UINT type = ::GetDriveTypeA("D:\\");
    if (type != DRIVE_FIXED && type != DRIVE_REMOTE && type != DRIVE_RAMDISK) {
        GTEST_SKIP() << "no drive D: here";
    }
    const bool made = !isDirectory("D:\\scratch");
    if (made) {
        ASSERT_TRUE(::CreateDirectoryA("D:\\scratch", nullptr) != 0);
    }
    setVariable("KOV_TEMP", "D:/scratch/");
    const std::string found = kov::getTempDirectory();
    const std::string from = source();
    if (made) {
        ::RemoveDirectoryA("D:\\scratch");
    }
    EXPECT_EQ(found, "D:\\scratch");
    EXPECT_EQ(from, "KOV_TEMP");
}

// A directory whose name needs the ANSI code page comes back in it, byte for byte: the search
// takes the narrow text through UTF-8 and back.
TEST_F(TempDirWin32Test, NonAsciiDirectoryComesBackInTheAnsiCodePage) {
    if (::GetACP() != 1252) {
        GTEST_SKIP() << "ANSI code page " << ::GetACP() << ", not 1252";
    }
    const std::string dir = at("caf\xE9");  // "café" in code page 1252
    ASSERT_TRUE(::CreateDirectoryA(dir.c_str(), nullptr) != 0) << dir;
    ASSERT_TRUE(
        ::GetFileAttributesW((std::wstring(base_.begin(), base_.end()) + L"\\caf\u00E9").c_str()) !=
        INVALID_FILE_ATTRIBUTES);
    setVariable("TMP", forwardSlashes(dir));
    EXPECT_EQ(kov::getTempDirectory(), dir);
    EXPECT_EQ(source(), "TMP");
}

TEST_F(TempDirWin32Test, DoubledSeparatorsAreCollapsed) {
    const std::string inner = makeDirectory("a\\b");
    setVariable("TEMP", forwardSlashes(base_) + "//a\\\\b\\");
    EXPECT_EQ(kov::getTempDirectory(), inner);
    EXPECT_EQ(source(), "TEMP");
}

TEST_F(TempDirWin32Test, BareDriveCountsAsExistingAndIsPublishedWithoutBackslash) {
    const std::string drive = std::string(1, absentDrive()) + ":";
    setVariable("KOV_TEMP", drive);
    EXPECT_EQ(kov::getTempDirectory(), drive);
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirWin32Test, BareDriveWithBackslashIsPublishedAsTheDriveAlone) {
    const std::string drive = std::string(1, absentDrive()) + ":";
    setVariable("TEMP", drive + "\\");
    EXPECT_EQ(kov::getTempDirectory(), drive);
    EXPECT_EQ(source(), "TEMP");
}

TEST_F(TempDirWin32Test, ASingleDotIsPublishedAsADot) {
    setVariable("KOV_TEMP", ".");
    EXPECT_EQ(kov::getTempDirectory(), ".");
    EXPECT_EQ(source(), "KOV_TEMP");
}

// The root of the current drive exists: it is chosen, and its native path, made only of
// separators, publishes as an empty text.
TEST_F(TempDirWin32Test, OnlySeparatorsValueNamesTheDriveRootAndPublishesEmpty) {
    const std::string tmp = makeDirectory("tmp");
    setVariable("KOV_TEMP", "/");
    setVariable("TMP", tmp);
    EXPECT_EQ(kov::getTempDirectory(), "");
    EXPECT_EQ(source(), "KOV_TEMP");
}

TEST_F(TempDirWin32Test, LocalAppDataTempWinsWhenNoVariableIsUsable) {
    char folder[MAX_PATH] = {};
    ASSERT_EQ(::SHGetFolderPathA(nullptr, CSIDL_LOCAL_APPDATA, nullptr, SHGFP_TYPE_CURRENT, folder),
              S_OK);
    const std::string expected = std::string(folder) + "\\Temp";
    if (!isDirectory(expected)) {
        ASSERT_TRUE(::CreateDirectoryA(expected.c_str(), nullptr) != 0) << expected;
    }
    setVariable("KOV_TEMP", at("missing"));
    EXPECT_EQ(kov::getTempDirectory(), expected);
    EXPECT_EQ(source(), "");
}

// The last two candidates of the fixed list, searched alone: c:\temp when it exists, and c:\tmp
// is then neither tested nor made.
TEST_F(TempDirWin32Test, FixedFallbackCTempWinsWhenItExists) {
    const std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    const bool tmpBefore = existsAtAll("c:\\tmp");
    const bool made = !isDirectory("c:\\temp");
    if (made) {
        ASSERT_TRUE(::CreateDirectoryA("c:\\temp", nullptr) != 0);
    }
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({list[4], list[5]});
    const bool tmpAfter = existsAtAll("c:\\tmp");
    if (made) {
        ::RemoveDirectoryA("c:\\temp");
    }
    EXPECT_EQ(found.path, "c:\\temp");
    EXPECT_EQ(found.source, "");
    EXPECT_EQ(tmpAfter, tmpBefore);
}

// Without c:\temp, c:\tmp is created and returned in native form. Runs where c:\temp is missing
// and c:\tmp is missing or an empty directory (which is removed first, and is there again after).
TEST_F(TempDirWin32Test, FixedFallbackCTmpIsCreatedWhenMissing) {
    const std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    if (existsAtAll("c:\\temp")) {
        GTEST_SKIP() << "c:\\temp exists here";
    }
    if (existsAtAll("c:\\tmp") && ::RemoveDirectoryA("c:\\tmp") == 0) {
        GTEST_SKIP() << "c:\\tmp exists here and is not an empty directory";
    }
    ASSERT_FALSE(existsAtAll("c:\\tmp"));
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({list[4], list[5]});
    EXPECT_EQ(found.path, "c:\\tmp");
    EXPECT_EQ(found.source, "");
    EXPECT_TRUE(isDirectory("c:\\tmp"));
    EXPECT_FALSE(existsAtAll("c:\\temp"));
}

// The whole list with nothing usable before the fixed fallbacks: the variables name nothing and
// the shell folder's candidate is missing (its locator stands in for a shell folder without Temp,
// and, in the second search, for a failed shell call); the answer is c:\temp or c:\tmp.
TEST_F(TempDirWin32Test, NothingUsableEndsAtTheFixedFallbacks) {
    std::vector<TempDirectoryCandidate> list = kov::tempDirectoryCandidates();
    ASSERT_EQ(list.size(), 6u);
    setVariable("KOV_TEMP", at("missing"));
    setVariable("TMP", makeFile("plain"));
    const std::string missingTemp = at("local") + "/Temp";
    list[3] = TempDirectoryCandidate::located("shell folder without Temp",
                                              [missingTemp] { return missingTemp; });
    const std::string expected = isDirectory("c:\\temp") ? "c:\\temp" : "c:\\tmp";
    kov::TempDirectorySearchResult found = kov::searchTempDirectory(list);
    EXPECT_EQ(found.path, expected);
    EXPECT_EQ(found.source, "");
    EXPECT_TRUE(isDirectory(expected));
    EXPECT_FALSE(existsAtAll(at("missing")));
    EXPECT_FALSE(existsAtAll(at("local")));

    list[3] = TempDirectoryCandidate::located("failed shell call",
                                              [] { return std::optional<std::string>(); });
    found = kov::searchTempDirectory(list);
    EXPECT_EQ(found.path, expected);
    EXPECT_EQ(found.source, "");
}

TEST_F(TempDirWin32Test, SearchCreatesOnlyTheLastDriveLetterCandidate) {
    const kov::TempDirectorySearchResult found = kov::searchTempDirectory({
        TempDirectoryCandidate::fixed(forwardSlashes(at("temp"))),
        TempDirectoryCandidate::fixed(forwardSlashes(at("tmp"))),
    });
    EXPECT_EQ(found.path, at("tmp"));
    EXPECT_TRUE(isDirectory(at("tmp")));
    EXPECT_FALSE(existsAtAll(at("temp")));
}

TEST_F(TempDirWin32Test, SecondCallReturnsTheFirstAnswerAfterTempChanged) {
    const std::string first = makeDirectory("first");
    setVariable("TEMP", first);
    ASSERT_EQ(kov::getTempDirectory(), first);
    setVariable("TEMP", makeDirectory("second"));
    EXPECT_EQ(kov::getTempDirectory(), first);
    EXPECT_EQ(source(), "TEMP");
}

}  // namespace
