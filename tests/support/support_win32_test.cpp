// File and directory objects on Windows itself: drives, network shares seen
// through their attributes, and moves between drives. Everything else is
// checked on every platform by the other support tests.
#include "support/Win32Api.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "support/FileSystem.h"
#include "support/KovDirectory.h"
#include "support/KovFile.h"
#include "support/Text.h"

namespace {

using kov::text::Utf8Text;
using lumo::ex::FileInfo;
using lumo::ex::KovDirectory;
using lumo::ex::KovFile;

// Forwards to the host file system and records the status calls.
class CountingFileSystem final : public kov::fs::FileSystem {
  public:
    kov::fs::FileSystem& host = kov::fs::hostFileSystem();
    std::vector<std::string> statusCalls;
    std::vector<std::string> attributeCalls;
    int moveCalls = 0;
    int copyCalls = 0;

    kov::path::PathStyle style() const override { return host.style(); }
    bool status(const std::string& path, kov::fs::Status& out) override {
        statusCalls.push_back(path);
        return host.status(path, out);
    }
    bool shareIsDirectory(const std::string& path) override {
        attributeCalls.push_back(path);
        return host.shareIsDirectory(path);
    }
    bool makeDirectory(const std::string& path) override { return host.makeDirectory(path); }
    bool removeFile(const std::string& path) override { return host.removeFile(path); }
    bool removeDirectory(const std::string& path) override { return host.removeDirectory(path); }
    bool isLink(const std::string& path) override { return host.isLink(path); }
    bool removeLink(const std::string& path) override { return host.removeLink(path); }
    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        ++copyCalls;
        return host.copyFile(from, to, failIfExists);
    }
    bool moveFile(const std::string& from, const std::string& to) override {
        ++moveCalls;
        return host.moveFile(from, to);
    }
    bool list(const std::string& path, std::vector<kov::fs::Entry>& out) override {
        return host.list(path, out);
    }
    std::int64_t now() override { return host.now(); }
    void openStream(std::fstream& stream, const std::string& path,
                    std::ios_base::openmode mode) override {
        host.openStream(stream, path, mode);
    }
};

// The letter of a drive that is absent, or 0 when every letter is taken.
char absentDrive() {
    const DWORD drives = GetLogicalDrives();
    for (int i = 25; i >= 3; --i) {
        if ((drives & (1u << i)) == 0)
            return static_cast<char>('A' + i);
    }
    return 0;
}

class SupportWin32 : public ::testing::Test {
  protected:
    void SetUp() override {
        previous_ = kov::fs::TEST_setFileSystem(&fs_);
        const char* temp = std::getenv("TEMP");
        ASSERT_NE(temp, nullptr);
        const std::string base = kov::text::narrowToUtf8Lossy(temp);
        for (unsigned n = GetTickCount();; ++n) {
            scratch_ = KovDirectory(base + "\\kov-support-" + std::to_string(n), 1, false);
            if (!scratch_.exists())
                break;
        }
        ASSERT_TRUE(scratch_.create());
        fs_.statusCalls.clear();
    }
    void TearDown() override {
        KovDirectory(scratch_.info()).remove();
        kov::fs::TEST_setFileSystem(previous_);
    }
    std::string at(const std::string& name) const {
        return scratch_.pathText(2).bytes() + "\\" + name;
    }

    CountingFileSystem fs_;
    kov::fs::FileSystem* previous_ = nullptr;
    KovDirectory scratch_{std::string(), 1, false};
};

TEST_F(SupportWin32, DrivesExistWithoutAStatusQuery) {
    KovDirectory c("C:", 1, false);
    EXPECT_TRUE(c.exists());
    const char q = absentDrive();
    ASSERT_NE(q, 0);
    KovDirectory absent(std::string(1, q) + ":", 1, false);
    EXPECT_TRUE(absent.exists());
    EXPECT_TRUE(fs_.statusCalls.empty());
    EXPECT_EQ(c.rootKind(), 3);
}

TEST_F(SupportWin32, ForcedReadOfADriveAsksItsRoot) {
    KovDirectory c("C:", 1, false);
    EXPECT_TRUE(c.refresh(true));
    ASSERT_EQ(fs_.statusCalls.size(), 1u);
    EXPECT_EQ(fs_.statusCalls[0], "C:\\");
    const char q = absentDrive();
    ASSERT_NE(q, 0);
    KovDirectory absent(std::string(1, q) + ":", 1, false);
    EXPECT_FALSE(absent.refresh(true));
    EXPECT_FALSE(absent.exists());
    EXPECT_EQ(fs_.statusCalls.back(), std::string(1, q) + ":\\");
}

TEST_F(SupportWin32, RemovingADriveIsRefused) {
    EXPECT_FALSE(KovDirectory("C:", 1, false).remove());
    EXPECT_FALSE(KovDirectory("\\", 1, false).remove());
}

TEST_F(SupportWin32, NetworkShareCountsThroughItsAttributes) {
    // The administrative share of the system drive; skipped where there is none.
    const std::string share = "\\\\localhost\\C$";
    const DWORD a = GetFileAttributesW(L"\\\\localhost\\C$");
    if (a == INVALID_FILE_ATTRIBUTES || (a & FILE_ATTRIBUTE_DIRECTORY) == 0) {
        GTEST_SKIP() << "no administrative share here";
    }
    KovDirectory d("//localhost/C$/", 1, false);
    EXPECT_EQ(d.path(2), share);
    EXPECT_TRUE(d.exists());
    EXPECT_EQ(d.kind(), FileInfo::kDirectory);
}

TEST_F(SupportWin32, MissingShareDoesNotExist) {
    KovDirectory d("\\\\kov-no-such-server\\none", 1, false);
    EXPECT_FALSE(d.exists());
    ASSERT_FALSE(fs_.attributeCalls.empty());
    EXPECT_EQ(fs_.attributeCalls.back(), "\\\\kov-no-such-server\\none");
}

TEST_F(SupportWin32, PathsUseBackslashes) {
    KovDirectory d("c:/temp//x/", 1, false);
    EXPECT_EQ(d.path(2), "c:\\temp\\x");
    EXPECT_EQ(d.path(0), "c:/temp/x");
}

TEST_F(SupportWin32, CreateCopyMoveAndRemoveInAScratchDirectory) {
    KovFile f(Utf8Text(at("a\\b\\file.bin")));
    ASSERT_TRUE(f.create());
    ASSERT_TRUE(f.open(std::ios::out | std::ios::binary));
    *f.stream() << "abc";
    ASSERT_TRUE(f.close());
    EXPECT_EQ(f.size(), 3);
    EXPECT_FALSE(f.copyTo(at("a\\b\\file.bin"), false));
    ASSERT_TRUE(f.copyTo(at("copy.bin"), false));
    EXPECT_EQ(KovFile(Utf8Text(at("copy.bin"))).size(), 3);
    ASSERT_TRUE(f.moveTo(at("moved.bin"), false));
    EXPECT_EQ(fs_.moveCalls, 1);
    EXPECT_EQ(f.path(2), at("moved.bin"));
    KovDirectory a(at("a"), 1, false);
    EXPECT_TRUE(a.remove());
    EXPECT_FALSE(KovDirectory(at("a"), 1, false).exists());
}

TEST_F(SupportWin32, MovingAcrossDrivesCopiesThenDeletes) {
    // Needs a second writable drive: the first fixed drive after the scratch
    // directory's own with a \tmp or \temp in it. (The Wine prefix of the
    // cross build maps D: to a directory of its own for this.)
    const std::string own = scratch_.path(2).substr(0, 2);
    std::string otherDir;
    const DWORD drives = GetLogicalDrives();
    for (int i = 2; i < 26 && otherDir.empty(); ++i) {
        if ((drives & (1u << i)) == 0)
            continue;
        const std::string letter = std::string(1, static_cast<char>('A' + i)) + ":";
        if (kov::text::equalsIgnoringCase(letter, own))
            continue;
        std::wstring root(letter.begin(), letter.end());
        root += L"\\";
        if (GetDriveTypeW(root.c_str()) != DRIVE_FIXED)
            continue;
        for (const char* sub : {"\\tmp", "\\temp"}) {
            KovDirectory candidate(letter + sub, 1, false);
            if (candidate.exists()) {
                KovDirectory probe(
                    letter + sub + "\\kov-support-move-" + std::to_string(GetCurrentProcessId()), 1,
                    false);
                if (probe.create()) {
                    otherDir = probe.path(2);
                    break;
                }
            }
        }
    }
    if (otherDir.empty())
        GTEST_SKIP() << "no second writable drive";
    RecordProperty("other_directory", otherDir);
    KovFile f(Utf8Text(at("cross.bin")));
    ASSERT_TRUE(f.create());
    const bool moved = f.moveTo(otherDir + "\\cross.bin", false);
    EXPECT_TRUE(moved);
    EXPECT_EQ(fs_.moveCalls, 0);
    EXPECT_EQ(fs_.copyCalls, 1);
    EXPECT_FALSE(KovFile(Utf8Text(at("cross.bin"))).exists());
    EXPECT_TRUE(KovFile(Utf8Text(otherDir + "\\cross.bin")).exists());
    KovDirectory(otherDir, 1, false).remove();
}

}  // namespace
