// Path text rules of both styles, and the Windows-style record and status
// rules (drives, network shares, cross-drive moves) run against an
// in-memory file system put in through the platform seam, so they are
// checked on every platform.
#include <gtest/gtest.h>

#include <map>
#include <string>
#include <vector>

#include "support/FileSystem.h"
#include "support/KovDirectory.h"
#include "support/KovFile.h"
#include "support/NativePath.h"

namespace {

using kov::path::PathStyle;
using kov::text::Utf8Text;
using lumo::ex::FileInfo;
using lumo::ex::KovDirectory;
using lumo::ex::KovFile;

// ---- Native form as text ----

TEST(NativePath, WindowsKeepsEmptySlashAndNetworkPrefixUnchanged) {
    EXPECT_EQ(kov::path::nativeForm("", PathStyle::Windows), "");
    EXPECT_EQ(kov::path::nativeForm("/", PathStyle::Windows), "/");
    EXPECT_EQ(kov::path::nativeForm("\\\\", PathStyle::Windows), "\\\\");
}

TEST(NativePath, WindowsSlashesDoubledAndTrailingSeparators) {
    EXPECT_EQ(kov::path::nativeForm("a//b/", PathStyle::Windows), "a\\b");
    EXPECT_EQ(kov::path::nativeForm("c:/temp", PathStyle::Windows), "c:\\temp");
    EXPECT_EQ(kov::path::nativeForm("C:/", PathStyle::Windows), "C:");
    EXPECT_EQ(kov::path::nativeForm("a\\b\\\\\\", PathStyle::Windows), "a\\b");
}

TEST(NativePath, WindowsNetworkPathKeepsItsLeadingPair) {
    EXPECT_EQ(kov::path::nativeForm("\\\\server\\share", PathStyle::Windows), "\\\\server\\share");
    EXPECT_EQ(kov::path::nativeForm("//server/share/", PathStyle::Windows), "\\\\server\\share");
    EXPECT_EQ(kov::path::nativeForm("\\\\server\\\\share", PathStyle::Windows),
              "\\\\server\\share");
}

TEST(NativePath, WindowsReplacesEachPairOnce) {
    // Pairs are replaced left to right in one pass: three become two.
    EXPECT_EQ(kov::path::nativeForm("a\\\\\\b", PathStyle::Windows), "a\\\\b");
    EXPECT_EQ(kov::path::nativeForm("a\\\\\\\\b", PathStyle::Windows), "a\\\\b");
}

TEST(NativePath, WindowsPathOfOnlySeparatorsBecomesEmpty) {
    EXPECT_EQ(kov::path::nativeForm("///", PathStyle::Windows), "");
    EXPECT_EQ(kov::path::nativeForm("\\\\\\", PathStyle::Windows), "");
}

TEST(NativePath, PosixCollapsesAndStripsButKeepsRoot) {
    EXPECT_EQ(kov::path::nativeForm("a//b/", PathStyle::Posix), "a/b");
    EXPECT_EQ(kov::path::nativeForm("///", PathStyle::Posix), "/");
    EXPECT_EQ(kov::path::nativeForm("/", PathStyle::Posix), "/");
    EXPECT_EQ(kov::path::nativeForm("", PathStyle::Posix), "");
    EXPECT_EQ(kov::path::nativeForm("//var///tmp//", PathStyle::Posix), "/var/tmp");
}

TEST(NativePath, PosixBackslashIsAnOrdinaryCharacter) {
    EXPECT_EQ(kov::path::nativeForm("a\\b/", PathStyle::Posix), "a\\b");
    EXPECT_EQ(kov::path::nativeForm("\\\\server\\share", PathStyle::Posix), "\\\\server\\share");
    EXPECT_EQ(kov::path::splitNative("a\\b/c", PathStyle::Posix),
              (std::vector<std::string>{"a\\b", "c"}));
}

TEST(NativePath, SplitsIntoRecords) {
    EXPECT_EQ(kov::path::splitNative("/a/b", PathStyle::Posix),
              (std::vector<std::string>{"/", "a", "b"}));
    EXPECT_EQ(kov::path::splitNative("\\\\srv\\s", PathStyle::Windows),
              (std::vector<std::string>{"\\\\", "srv", "s"}));
    EXPECT_EQ(kov::path::splitNative("\\a", PathStyle::Windows),
              (std::vector<std::string>{"\\", "a"}));
    EXPECT_EQ(kov::path::splitNative("C:\\x\\y", PathStyle::Windows),
              (std::vector<std::string>{"C:", "x", "y"}));
    EXPECT_TRUE(kov::path::splitNative("", PathStyle::Posix).empty());
}

TEST(NativePath, JoinsWithOneSeparator) {
    EXPECT_EQ(kov::path::joinComponent("/", "a", PathStyle::Posix), "/a");
    EXPECT_EQ(kov::path::joinComponent("/a", "b", PathStyle::Posix), "/a/b");
    EXPECT_EQ(kov::path::joinComponent("\\\\", "srv", PathStyle::Windows), "\\\\srv");
    EXPECT_EQ(kov::path::joinComponent("C:", "x", PathStyle::Windows), "C:\\x");
    EXPECT_EQ(kov::path::joinComponent("", "x", PathStyle::Windows), "x");
}

TEST(NativePath, RootKindsOfBothStyles) {
    EXPECT_EQ(kov::path::rootKindOf("\\", PathStyle::Windows), 1);
    EXPECT_EQ(kov::path::rootKindOf("\\\\", PathStyle::Windows), 1);
    EXPECT_EQ(kov::path::rootKindOf(".", PathStyle::Windows), 2);
    EXPECT_EQ(kov::path::rootKindOf("C:", PathStyle::Windows), 3);
    EXPECT_EQ(kov::path::rootKindOf("q:", PathStyle::Windows), 3);
    EXPECT_EQ(kov::path::rootKindOf("1:", PathStyle::Windows), 0);
    EXPECT_EQ(kov::path::rootKindOf("C:x", PathStyle::Windows), 0);
    EXPECT_EQ(kov::path::rootKindOf("/", PathStyle::Posix), 1);
    EXPECT_EQ(kov::path::rootKindOf(".", PathStyle::Posix), 2);
    EXPECT_EQ(kov::path::rootKindOf("C:", PathStyle::Posix), 0);
    EXPECT_TRUE(kov::path::isPresumedRoot("\\\\", PathStyle::Windows));
    EXPECT_FALSE(kov::path::isPresumedRoot("\\", PathStyle::Windows));
    EXPECT_TRUE(kov::path::isPresumedRoot("/", PathStyle::Posix));
    EXPECT_FALSE(kov::path::isPresumedRoot("C:", PathStyle::Posix));
}

TEST(NativePath, PortableFormUsesForwardSlashes) {
    EXPECT_EQ(kov::path::portableForm("c:\\temp\\x", PathStyle::Windows), "c:/temp/x");
    EXPECT_EQ(kov::path::portableForm("/a//b", PathStyle::Posix), "/a/b");
}

// ---- Windows rules through an in-memory file system ----

// A Windows-style file system held in memory; every call is counted.
class MemoryWindowsFileSystem final : public kov::fs::FileSystem {
  public:
    std::map<std::string, kov::fs::Status> nodes;  // native path -> status
    std::vector<std::string> shares;               // roots reported by attributes
    std::vector<std::string> statusCalls;
    int moveCalls = 0;
    int copyCalls = 0;
    int removeCalls = 0;
    int otherCalls = 0;

    void addDirectory(const std::string& path, std::uint32_t drive) {
        kov::fs::Status st;
        st.directory = true;
        st.mode = 0x4000;
        st.device = drive;
        nodes[path] = st;
    }
    void addFile(const std::string& path, std::uint32_t drive, std::int64_t size) {
        kov::fs::Status st;
        st.mode = 0x8000;
        st.size = size;
        st.device = drive;
        nodes[path] = st;
    }

    PathStyle style() const override { return PathStyle::Windows; }
    bool status(const std::string& path, kov::fs::Status& out) override {
        statusCalls.push_back(path);
        auto it = nodes.find(path);
        if (it == nodes.end())
            return false;
        out = it->second;
        return true;
    }
    bool shareIsDirectory(const std::string& path) override {
        for (const auto& s : shares) {
            if (s == path)
                return true;
        }
        return false;
    }
    bool makeDirectory(const std::string& path) override {
        ++otherCalls;
        if (nodes.count(path))
            return false;
        addDirectory(path, path.size() > 1 && path[1] == ':' ? driveOf(path) : 0);
        return true;
    }
    bool removeFile(const std::string& path) override {
        ++removeCalls;
        return nodes.erase(path) == 1;
    }
    bool removeDirectory(const std::string& path) override {
        ++removeCalls;
        return nodes.erase(path) == 1;
    }
    bool isLink(const std::string&) override { return false; }
    bool removeLink(const std::string& path) override { return removeFile(path); }
    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        ++copyCalls;
        auto it = nodes.find(from);
        if (it == nodes.end() || (failIfExists && nodes.count(to)))
            return false;
        kov::fs::Status st = it->second;
        st.device = driveOf(to);
        nodes[to] = st;
        return true;
    }
    bool moveFile(const std::string& from, const std::string& to) override {
        ++moveCalls;
        auto it = nodes.find(from);
        if (it == nodes.end())
            return false;
        nodes[to] = it->second;
        nodes.erase(from);
        return true;
    }
    bool list(const std::string& path, std::vector<kov::fs::Entry>& out) override {
        ++otherCalls;
        const std::string prefix = path + "\\";
        for (const auto& [name, st] : nodes) {
            if (name.compare(0, prefix.size(), prefix) == 0 &&
                name.find('\\', prefix.size()) == std::string::npos) {
                out.push_back(kov::fs::Entry{name.substr(prefix.size()), st.directory});
            }
        }
        return nodes.count(path) == 1;
    }
    std::int64_t now() override { return 1000; }
    void openStream(std::fstream& stream, const std::string&, std::ios_base::openmode) override {
        ++otherCalls;
        stream.setstate(std::ios_base::failbit);
    }

    static std::uint32_t driveOf(const std::string& path) {
        const char c = static_cast<char>(path[0] | 0x20);
        return static_cast<std::uint32_t>(c - 'a');
    }
};

class WindowsRules : public ::testing::Test {
  protected:
    void SetUp() override { previous_ = kov::fs::TEST_setFileSystem(&fs_); }
    void TearDown() override { kov::fs::TEST_setFileSystem(previous_); }

    MemoryWindowsFileSystem fs_;
    kov::fs::FileSystem* previous_ = nullptr;
};

TEST_F(WindowsRules, DriveExistsWithoutAnyStatusQuery) {
    KovDirectory present("C:", 1, false);
    KovDirectory absent("Q:", 1, false);
    EXPECT_TRUE(present.exists());
    EXPECT_TRUE(absent.exists());
    EXPECT_TRUE(fs_.statusCalls.empty());
    EXPECT_EQ(absent.rootKind(), 3);
}

TEST_F(WindowsRules, ForcedReadAsksTheDriveRootWithABackslash) {
    fs_.addDirectory("C:\\", 2);
    KovDirectory present("C:", 1, false);
    KovDirectory absent("Q:", 1, false);
    EXPECT_TRUE(present.refresh(true));
    EXPECT_FALSE(absent.refresh(true));
    EXPECT_EQ(fs_.statusCalls, (std::vector<std::string>{"C:\\", "Q:\\"}));
    EXPECT_TRUE(present.exists());
    EXPECT_FALSE(absent.exists());
}

TEST_F(WindowsRules, NetworkShareKeepsItsPrefixAndExistsThroughAttributes) {
    KovDirectory share("//server/share/", 1, false);
    EXPECT_EQ(share.path(2), "\\\\server\\share");
    EXPECT_FALSE(share.exists());  // the status call fails and no attributes say otherwise
    fs_.shares.push_back("\\\\server\\share");
    EXPECT_TRUE(share.refresh(true));
    EXPECT_TRUE(share.exists());
    EXPECT_EQ(share.kind(), FileInfo::kDirectory);
    EXPECT_EQ(share.rootKind(), 1);
}

TEST_F(WindowsRules, NetworkPrefixRecordIsPresumedWithUnknownKind) {
    auto record = FileInfo::fromPath("\\\\server\\share", 1, false);
    ASSERT_TRUE(record);
    const FileInfo* first = record.get();
    while (first->parent_)
        first = first->parent_.get();
    EXPECT_EQ(first->name_.bytes(), "\\\\");
    EXPECT_EQ(first->exists_, 1);
    EXPECT_EQ(first->statusRead_, 1);
    EXPECT_EQ(first->kind_, FileInfo::kUnknown);
    EXPECT_EQ(record->exists_, 0);
}

TEST_F(WindowsRules, PathTextInBothStyles) {
    KovFile f(Utf8Text("a//b/"), 1, false);
    EXPECT_EQ(f.path(2), "a\\b");
    KovDirectory t("c:/temp", 1, false);
    EXPECT_EQ(t.path(2), "c:\\temp");
    EXPECT_EQ(t.path(0), "c:/temp");
    EXPECT_EQ(t.pathText(2).bytes(), "c:\\temp");
}

TEST_F(WindowsRules, RemovingADriveIsRefusedWithoutAnyCall) {
    fs_.addDirectory("C:\\", 2);
    KovDirectory drive("C:", 1, false);
    EXPECT_FALSE(drive.remove());
    KovDirectory lone("\\", 1, false);
    EXPECT_FALSE(lone.remove());
    EXPECT_EQ(fs_.removeCalls, 0);
    EXPECT_EQ(fs_.otherCalls, 0);
}

TEST_F(WindowsRules, MovingAcrossDrivesCopiesThenDeletes) {
    fs_.addDirectory("C:\\", 2);
    fs_.addDirectory("C:\\data", 2);
    fs_.addFile("C:\\data\\a.bin", 2, 42);
    fs_.addDirectory("D:\\", 3);
    fs_.addDirectory("D:\\out", 3);
    KovFile f(Utf8Text("C:/data/a.bin"), 1, false);
    ASSERT_TRUE(f.moveTo(std::string("D:/out/a.bin"), false));
    EXPECT_EQ(fs_.moveCalls, 0);
    EXPECT_EQ(fs_.copyCalls, 1);
    EXPECT_EQ(fs_.nodes.count("C:\\data\\a.bin"), 0u);
    ASSERT_EQ(fs_.nodes.count("D:\\out\\a.bin"), 1u);
    EXPECT_EQ(f.path(2), "D:\\out\\a.bin");
    EXPECT_EQ(f.size(), 42);
}

TEST_F(WindowsRules, MovingWithinADriveRenames) {
    fs_.addDirectory("C:\\", 2);
    fs_.addDirectory("C:\\data", 2);
    fs_.addFile("C:\\data\\a.bin", 2, 7);
    KovFile f(Utf8Text("C:\\data\\a.bin"), 1, false);
    ASSERT_TRUE(f.moveTo(Utf8Text("C:\\data\\b.bin"), false));
    EXPECT_EQ(fs_.moveCalls, 1);
    EXPECT_EQ(fs_.copyCalls, 0);
    EXPECT_EQ(f.path(2), "C:\\data\\b.bin");
    EXPECT_TRUE(f.exists());
}

TEST_F(WindowsRules, CreatingAChainMakesEachMissingDirectoryOutermostFirst) {
    fs_.addDirectory("C:\\", 2);
    fs_.addDirectory("C:\\x", 2);
    KovDirectory z("C:/x/y/z", 1, false);
    ASSERT_TRUE(z.create());
    EXPECT_EQ(fs_.nodes.count("C:\\x\\y"), 1u);
    EXPECT_EQ(fs_.nodes.count("C:\\x\\y\\z"), 1u);
    EXPECT_TRUE(z.exists());
}

}  // namespace
