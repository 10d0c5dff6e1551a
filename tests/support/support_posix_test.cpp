// File and directory objects against a real file system: each test works
// in a scratch directory of its own, made and removed by the fixture.
// Platform calls that a test needs to steer (a rename refused as between
// devices, a directory that cannot be removed) go through a forwarding file
// system put in through the platform seam.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>
#include <vector>

#include "scratch_directory.h"
#include "support/FileSystem.h"
#include "support/KovDirectory.h"
#include "support/KovFile.h"
#include "support/Text.h"

namespace {

using kov::text::Utf8Text;
using lumo::ex::FileInfo;
using lumo::ex::KovDirectory;
using lumo::ex::KovFile;

// Forwards to the host file system, recording calls and refusing what a
// test asks it to refuse.
class SteeredFileSystem final : public kov::fs::FileSystem {
  public:
    kov::fs::FileSystem& host = kov::fs::hostFileSystem();
    std::string otherDevicePrefix;  // paths under it report another device
    bool refuseMoves = false;
    bool refuseDirectoryRemoval = false;
    bool refuseAllChanges = false;
    // How a listing fails: 0 never; 1 before any name (as when the directory
    // cannot be opened); 2 after every name has been read.
    int listingFailure = 0;
    std::int64_t fixedNow = 0;  // when non-zero, the clock
    std::vector<std::string> madeDirectories;
    int moveCalls = 0;
    int changeCalls = 0;
    int listCalls = 0;

    kov::path::PathStyle style() const override { return host.style(); }
    bool status(const std::string& path, kov::fs::Status& out) override {
        if (!host.status(path, out))
            return false;
        if (!otherDevicePrefix.empty() &&
            path.compare(0, otherDevicePrefix.size(), otherDevicePrefix) == 0) {
            out.device ^= 0x5A5A;
        }
        return true;
    }
    bool shareIsDirectory(const std::string& path) override { return host.shareIsDirectory(path); }
    bool makeDirectory(const std::string& path) override {
        ++changeCalls;
        madeDirectories.push_back(path);
        return !refuseAllChanges && host.makeDirectory(path);
    }
    bool removeFile(const std::string& path) override {
        ++changeCalls;
        return !refuseAllChanges && host.removeFile(path);
    }
    bool removeDirectory(const std::string& path) override {
        ++changeCalls;
        return !refuseAllChanges && !refuseDirectoryRemoval && host.removeDirectory(path);
    }
    bool isLink(const std::string& path) override { return host.isLink(path); }
    bool removeLink(const std::string& path) override {
        ++changeCalls;
        return !refuseAllChanges && host.removeLink(path);
    }
    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        ++changeCalls;
        return !refuseAllChanges && host.copyFile(from, to, failIfExists);
    }
    bool moveFile(const std::string& from, const std::string& to) override {
        ++moveCalls;
        ++changeCalls;
        return !refuseAllChanges && !refuseMoves && host.moveFile(from, to);
    }
    bool list(const std::string& path, std::vector<kov::fs::Entry>& out) override {
        ++listCalls;
        if (listingFailure == 1)
            return false;
        const bool listed = host.list(path, out);
        return listingFailure == 2 ? false : listed;
    }
    std::int64_t now() override { return fixedNow != 0 ? fixedNow : host.now(); }
    void openStream(std::fstream& stream, const std::string& path,
                    std::ios_base::openmode mode) override {
        ++changeCalls;
        if (refuseAllChanges) {
            stream.setstate(std::ios_base::failbit);
            return;
        }
        host.openStream(stream, path, mode);
    }
};

// Makes `directory` the working directory for its lifetime.
class WorkingDirectory {
  public:
    explicit WorkingDirectory(const std::string& directory) {
        char buffer[4096];
        if (::getcwd(buffer, sizeof buffer) != nullptr)
            previous_ = buffer;
        entered_ = ::chdir(directory.c_str()) == 0;
    }
    ~WorkingDirectory() {
        if (entered_ && !previous_.empty())
            static_cast<void>(::chdir(previous_.c_str()));
    }
    WorkingDirectory(const WorkingDirectory&) = delete;
    WorkingDirectory& operator=(const WorkingDirectory&) = delete;
    bool entered() const { return entered_ && !previous_.empty(); }

  private:
    std::string previous_;
    bool entered_ = false;
};

class Support : public ::testing::Test {
  protected:
    void SetUp() override {
        root_ = scratch_.path();
        ASSERT_FALSE(root_.empty()) << "no scratch directory";
        previous_ = kov::fs::TEST_setFileSystem(&fs_);
    }
    void TearDown() override {
        kov::fs::TEST_setFileSystem(previous_);
        // Directories a test made unreadable are opened up again, so that the scratch directory
        // can be removed with everything in it.
        std::error_code ec;
        for (auto& p : std::filesystem::recursive_directory_iterator(
                 root_, std::filesystem::directory_options::skip_permission_denied, ec)) {
            if (p.is_directory(ec) && !p.is_symlink(ec))
                ::chmod(p.path().c_str(), 0700);
        }
    }

    std::string at(const std::string& relative) const { return root_ + "/" + relative; }
    void writeFile(const std::string& relative, const std::string& content) const {
        std::ofstream out(at(relative), std::ios::binary);
        out << content;
    }
    std::string readFile(const std::string& relative) const {
        std::ifstream in(at(relative), std::ios::binary);
        return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
    }
    bool isDir(const std::string& relative) const {
        struct stat st;
        return ::stat(at(relative).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    }
    bool present(const std::string& relative) const {
        struct stat st;
        return ::lstat(at(relative).c_str(), &st) == 0;
    }
    void makeDir(const std::string& relative) const {
        ASSERT_EQ(::mkdir(at(relative).c_str(), 0700), 0) << relative;
    }
    void setModificationTime(const std::string& relative, std::int64_t seconds) const {
        struct timeval times[2] = {{static_cast<time_t>(seconds), 0},
                                   {static_cast<time_t>(seconds), 0}};
        ASSERT_EQ(::utimes(at(relative).c_str(), times), 0);
    }
    static std::set<std::string> names(const std::vector<KovFile>& files) {
        std::set<std::string> out;
        for (const KovFile& f : files)
            out.insert(f.name().bytes());
        return out;
    }

    kov::test::ScratchDirectory scratch_{"kov-support-"};
    std::string root_;
    SteeredFileSystem fs_;
    kov::fs::FileSystem* previous_ = nullptr;
};

// ---- status, existence and path text ----

TEST_F(Support, FileStatusIsReadFromDisk) {
    writeFile("a.txt", "hello");
    KovFile f(Utf8Text(at("a.txt")));
    EXPECT_TRUE(f.exists());
    EXPECT_EQ(f.kind(), FileInfo::kFile);
    EXPECT_EQ(f.size(), 5);
    EXPECT_GT(f.modificationTime(), 0);
    EXPECT_GT(f.accessTime(), 0);
    EXPECT_GT(f.creationTime(), 0);
    EXPECT_NE(f.info()->mode_ & 0x8000, 0);
}

TEST_F(Support, StatusIsCachedUntilAForcedRead) {
    KovFile f(Utf8Text(at("late.txt")));
    EXPECT_FALSE(f.exists());
    writeFile("late.txt", "x");
    EXPECT_FALSE(f.exists());
    EXPECT_TRUE(f.refresh(true));
    EXPECT_TRUE(f.exists());
}

TEST_F(Support, PresumedExistingIsBelievedUntilAForcedRead) {
    KovDirectory d(at("nowhere"), 1, true);
    EXPECT_TRUE(d.exists());
    EXPECT_FALSE(d.refresh(true));
    EXPECT_FALSE(d.exists());
}

TEST_F(Support, RegularFileSeenAsDirectoryDoesNotExist) {
    writeFile("plain", "x");
    KovDirectory d(at("plain"), 1, false);
    EXPECT_FALSE(d.exists());
    EXPECT_FALSE(d.readEntries());
    KovFile f(Utf8Text(at("plain")));
    EXPECT_TRUE(f.exists());
    // The size accessor re-reads the status; the directory still does not exist.
    EXPECT_EQ(d.size(), 1);
    EXPECT_FALSE(d.exists());
}

TEST_F(Support, DirectoryExists) {
    makeDir("d");
    KovDirectory d(at("d"), 1, false);
    EXPECT_TRUE(d.exists());
    EXPECT_EQ(d.kind(), FileInfo::kDirectory);
    EXPECT_FALSE(KovDirectory(at("missing"), 1, false).exists());
}

TEST_F(Support, NativePathTextIsNormalised) {
    KovDirectory d(root_ + "//a///b/", 1, false);
    EXPECT_EQ(d.path(2), root_ + "/a/b");
    EXPECT_EQ(d.pathText(2).bytes(), root_ + "/a/b");
    EXPECT_EQ(d.path(0), root_ + "/a/b");
    EXPECT_EQ(d.name().bytes(), "b");
    EXPECT_EQ(KovDirectory("a\\b", 1, false).path(2), "a\\b");
}

TEST_F(Support, RootRecordsArePresumed) {
    KovDirectory slash("/", 1, false);
    EXPECT_TRUE(slash.exists());
    EXPECT_EQ(slash.rootKind(), 1);
    KovDirectory dot(".", 1, false);
    EXPECT_TRUE(dot.exists());
    EXPECT_EQ(dot.rootKind(), 2);
    EXPECT_EQ(KovDirectory(at("x"), 1, false).rootKind(), 1);
    EXPECT_EQ(KovFile(Utf8Text("rel/x")).rootKind(), 0);
    EXPECT_EQ(fs_.listCalls, 0);
}

TEST_F(Support, CopiesAndAssignmentShareTheRecord) {
    writeFile("s.txt", "abc");
    KovFile a(Utf8Text(at("s.txt")));
    KovFile b(a);
    EXPECT_EQ(a.info(), b.info());
    EXPECT_TRUE(b.exists());
    EXPECT_EQ(a.info()->statusRead_, 1);
    KovFile c(Utf8Text(at("other")));
    c = a;
    EXPECT_EQ(c.info(), a.info());
    KovDirectory d1(at("d1"), 1, false);
    KovDirectory d2(root_, 1, false);
    d1 = d2;
    EXPECT_EQ(d1.path(2), root_);
    KovDirectory fromFile(a);
    EXPECT_EQ(fromFile.info(), a.info());
}

// ---- case ----

TEST_F(Support, CaseResolutionAdoptsTheNameOnDisk) {
    writeFile("ReadMe.txt", "x");
    KovFile f(Utf8Text(at("readme.TXT")), 2, false);
    EXPECT_TRUE(f.exists());
    EXPECT_EQ(f.name().bytes(), "ReadMe.txt");
    EXPECT_EQ(f.path(2), at("ReadMe.txt"));
}

TEST_F(Support, CaseModeOneNeverResolves) {
    writeFile("ReadMe.txt", "x");
    KovFile f(Utf8Text(at("readme.TXT")), 1, false);
    EXPECT_FALSE(f.exists());
    EXPECT_EQ(fs_.listCalls, 0);
}

TEST_F(Support, CaseResolutionRunsOncePerObject) {
    KovFile f(Utf8Text(at("Later.txt")), 2, false);
    EXPECT_FALSE(f.exists());
    const int lists = fs_.listCalls;
    EXPECT_EQ(lists, 1);
    writeFile("later.txt", "x");
    EXPECT_FALSE(f.exists());
    EXPECT_EQ(fs_.listCalls, lists);
}

// The one name of a relative path has no parent record: case resolution
// stops there, without listing the working directory. Under "." it runs.
TEST_F(Support, CaseResolutionStopsWithoutAParentRecord) {
    writeFile("ReadMe.txt", "x");
    WorkingDirectory inside(root_);
    ASSERT_TRUE(inside.entered());
    KovFile bare(Utf8Text("readme.TXT"), 2, false);
    EXPECT_FALSE(bare.exists());
    EXPECT_EQ(bare.name().bytes(), "readme.TXT");
    EXPECT_EQ(fs_.listCalls, 0);
    KovFile dotted(Utf8Text("./readme.TXT"), 2, false);
    EXPECT_TRUE(dotted.exists());
    EXPECT_EQ(dotted.name().bytes(), "ReadMe.txt");
    EXPECT_EQ(fs_.listCalls, 1);
}

TEST_F(Support, CaseResolutionRespectsTheKnownKind) {
    writeFile("Notes", "x");
    makeDir("Data");
    // A directory object knows it looks for a directory: the file does not do.
    KovDirectory notes(at("notes"), 2, false);
    EXPECT_FALSE(notes.exists());
    EXPECT_EQ(notes.name().bytes(), "notes");
    KovDirectory data(at("DATA"), 2, false);
    EXPECT_TRUE(data.exists());
    EXPECT_EQ(data.name().bytes(), "Data");
    // A file object of unknown kind takes whatever differs only in case.
    KovFile any(Utf8Text(at("NOTES")), 2, false);
    EXPECT_TRUE(any.exists());
    EXPECT_EQ(any.name().bytes(), "Notes");
}

TEST_F(Support, ContainsInBothCaseModes) {
    writeFile("Alpha", "x");
    KovDirectory exact(root_, 0, false);
    EXPECT_TRUE(exact.contains(Utf8Text("Alpha")));
    EXPECT_FALSE(exact.contains(Utf8Text("alpha")));
    KovDirectory folded(root_, 1, false);
    EXPECT_TRUE(folded.contains(Utf8Text("ALPHA")));
    EXPECT_FALSE(folded.contains(Utf8Text("Alph")));
}

// ---- creation ----

TEST_F(Support, CreatingAThreeLevelChainGoesOutermostFirst) {
    makeDir("x");
    KovDirectory z(at("x/y/z"), 1, false);
    ASSERT_TRUE(z.create());
    EXPECT_EQ(fs_.madeDirectories, (std::vector<std::string>{at("x/y"), at("x/y/z")}));
    EXPECT_TRUE(isDir("x/y/z"));
    EXPECT_TRUE(z.exists());
    EXPECT_TRUE(z.create());  // already there
    EXPECT_EQ(fs_.madeDirectories.size(), 2u);
}

TEST_F(Support, CreatingAFileMakesItsParents) {
    KovFile f(Utf8Text(at("p/q/file.bin")));
    ASSERT_TRUE(f.create());
    EXPECT_TRUE(isDir("p/q"));
    EXPECT_TRUE(present("p/q/file.bin"));
    EXPECT_EQ(f.size(), 0);
    EXPECT_TRUE(f.exists());
}

TEST_F(Support, CreatingAnExistingFileKeepsItsContent) {
    writeFile("keep", "content");
    KovFile f(Utf8Text(at("keep")));
    EXPECT_TRUE(f.create());
    EXPECT_EQ(readFile("keep"), "content");
}

// The path exists (as a directory, kind 2): create is true at once and
// nothing on disk changes.
TEST_F(Support, CreatingAFileWhereADirectoryIsIsTrueAndTouchesNothing) {
    makeDir("dir");
    KovFile f(Utf8Text(at("dir")));
    EXPECT_TRUE(f.create());
    EXPECT_EQ(fs_.changeCalls, 0);
    EXPECT_TRUE(isDir("dir"));
    EXPECT_EQ(f.kind(), FileInfo::kDirectory);
    std::vector<KovFile> listed;
    ASSERT_TRUE(KovDirectory(at("dir"), 1, false).entries(listed));
    EXPECT_TRUE(listed.empty());
}

// A path of one relative name has no parent record: it cannot be created,
// and nothing is made in the working directory. Under "." it can.
TEST_F(Support, CreatingTheOneNameOfARelativePathIsRefused) {
    WorkingDirectory inside(root_);
    ASSERT_TRUE(inside.entered());
    KovFile bare(Utf8Text("bar"));
    EXPECT_FALSE(bare.create());
    EXPECT_EQ(fs_.changeCalls, 0);
    EXPECT_FALSE(present("bar"));
    // An existing file of one relative name needs no creation: true.
    writeFile("there", "t");
    EXPECT_TRUE(KovFile(Utf8Text("there")).create());
    EXPECT_EQ(fs_.changeCalls, 0);
    EXPECT_EQ(readFile("there"), "t");
    KovFile dotted(Utf8Text("./bar"));
    EXPECT_TRUE(dotted.create());
    EXPECT_TRUE(present("bar"));
}

TEST_F(Support, CreatingADirectoryWhereAFileIsFails) {
    writeFile("plain", "x");
    EXPECT_FALSE(KovDirectory(at("plain"), 1, false).create());
    EXPECT_EQ(readFile("plain"), "x");
}

// ---- removal ----

TEST_F(Support, RemovingAFile) {
    writeFile("f", "x");
    KovFile f(Utf8Text(at("f")));
    EXPECT_TRUE(f.remove());
    EXPECT_FALSE(present("f"));
    EXPECT_FALSE(f.exists());
    EXPECT_TRUE(f.remove());  // nothing left to remove
}

TEST_F(Support, RemovingATreeThreeLevelsDeep) {
    makeDir("t");
    makeDir("t/a");
    makeDir("t/a/b");
    makeDir("t/a2");
    writeFile("t/f0", "0");
    writeFile("t/a/f1", "1");
    writeFile("t/a/b/f2", "2");
    writeFile("t/a/b/g2", "2");
    KovDirectory t(at("t"), 1, false);
    ASSERT_TRUE(t.remove());
    EXPECT_FALSE(present("t"));
    EXPECT_FALSE(t.exists());
    EXPECT_TRUE(isDir(""));
}

TEST_F(Support, RemovingAMissingDirectoryFails) {
    EXPECT_FALSE(KovDirectory(at("nothing"), 1, false).remove());
}

TEST_F(Support, RemovalNeverFollowsALink) {
    makeDir("outside");
    writeFile("outside/precious", "p");
    makeDir("t");
    ASSERT_EQ(::symlink(at("outside").c_str(), at("t/link").c_str()), 0);
    KovDirectory t(at("t"), 1, false);
    ASSERT_TRUE(t.remove());
    EXPECT_FALSE(present("t"));
    EXPECT_EQ(readFile("outside/precious"), "p");
    // A directory object on the link itself takes only the link away.
    ASSERT_EQ(::symlink(at("outside").c_str(), at("link2").c_str()), 0);
    EXPECT_TRUE(KovDirectory(at("link2"), 1, false).remove());
    EXPECT_FALSE(present("link2"));
    EXPECT_EQ(readFile("outside/precious"), "p");
}

TEST_F(Support, FileRemovalOfADirectoryReportsSuccessEvenWhenItStays) {
    makeDir("stuck");
    writeFile("stuck/inner", "x");
    fs_.refuseDirectoryRemoval = true;
    KovFile f(Utf8Text(at("stuck")));
    EXPECT_TRUE(f.remove());
    EXPECT_TRUE(isDir("stuck"));
    EXPECT_FALSE(present("stuck/inner"));
    EXPECT_FALSE(KovDirectory(at("stuck"), 1, false).remove());
}

TEST_F(Support, RemovingTheFirstRecordOfAChainIsRefused) {
    makeDir("foo");
    writeFile("foo/inner", "i");
    WorkingDirectory inside(root_);
    ASSERT_TRUE(inside.entered());
    fs_.refuseAllChanges = true;  // a safety net: nothing may be touched
    EXPECT_FALSE(KovDirectory("/", 1, false).remove());
    EXPECT_FALSE(KovDirectory(".", 1, false).remove());
    EXPECT_FALSE(KovDirectory("///", 1, false).remove());
    // One relative name is the first record of its chain too.
    KovDirectory foo("foo", 1, false);
    EXPECT_TRUE(foo.exists());
    EXPECT_FALSE(foo.remove());
    EXPECT_FALSE(KovDirectory("foo/", 1, false).remove());
    EXPECT_EQ(fs_.changeCalls, 0);
    EXPECT_EQ(fs_.listCalls, 0);
    EXPECT_TRUE(isDir("foo"));
    EXPECT_EQ(readFile("foo/inner"), "i");
    // Under "." the same directory has a parent record and goes.
    fs_.refuseAllChanges = false;
    EXPECT_TRUE(KovDirectory("./foo", 1, false).remove());
    EXPECT_FALSE(present("foo"));
}

// A directory that can be changed but not listed: the listing is empty and
// true, so an empty one is removed. The listing failure comes from the
// seam, so this holds whoever runs the test (root lists a mode 0300
// directory all the same).
TEST_F(Support, AnEmptyDirectoryThatCannotBeListedIsRemoved) {
    makeDir("locked");
    fs_.listingFailure = 1;
    KovDirectory d(at("locked"), 1, false);
    EXPECT_TRUE(d.readEntries());
    std::vector<KovFile> listed;
    EXPECT_TRUE(d.entries(listed));
    EXPECT_TRUE(listed.empty());
    EXPECT_FALSE(d.contains(Utf8Text("anything")));
    EXPECT_TRUE(d.remove());
    EXPECT_FALSE(present("locked"));
    EXPECT_FALSE(d.exists());
}

// Not listed, not empty: the entries are not found, so the directory stays
// with what is in it, and removal reports false.
TEST_F(Support, AFullDirectoryThatCannotBeListedStays) {
    makeDir("locked");
    writeFile("locked/inner", "i");
    fs_.listingFailure = 1;
    KovDirectory d(at("locked"), 1, false);
    EXPECT_FALSE(d.remove());
    EXPECT_TRUE(isDir("locked"));
    EXPECT_EQ(readFile("locked/inner"), "i");
}

// A listing that fails part way keeps the names read before the failure,
// and the cache is read again next time (an empty or failed listing is
// never taken as current).
TEST_F(Support, AListingThatFailsPartWayKeepsWhatItRead) {
    writeFile("a", "");
    writeFile("b", "");
    fs_.listingFailure = 2;
    fs_.fixedNow = 2000000000;
    setModificationTime("", fs_.fixedNow - 10);
    KovDirectory d(root_, 1, false);
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"a", "b"}));
    fs_.listingFailure = 1;
    listed.clear();
    setModificationTime("", fs_.fixedNow);
    ASSERT_TRUE(d.entries(listed));
    EXPECT_TRUE(listed.empty());
    const int lists = fs_.listCalls;
    ASSERT_TRUE(d.readEntries());
    EXPECT_EQ(fs_.listCalls, lists + 1);
}

// The same with the host's own refusal: a directory of mode 0300 (write and
// search, no read). Root reads it regardless, so this needs another user.
TEST_F(Support, AnUnreadableEmptyDirectoryIsRemoved) {
    if (::geteuid() == 0)
        GTEST_SKIP() << "root lists a directory of mode 0300; the seam test covers root";
    makeDir("locked");
    ASSERT_EQ(::chmod(at("locked").c_str(), 0300), 0);
    std::vector<kov::fs::Entry> probe;
    ASSERT_FALSE(kov::fs::hostFileSystem().list(at("locked"), probe));
    KovDirectory d(at("locked"), 1, false);
    EXPECT_TRUE(d.readEntries());
    EXPECT_TRUE(d.remove());
    EXPECT_FALSE(present("locked"));
}

// ---- copying ----

TEST_F(Support, CopyingOntoAnExistingFileWithoutOverwrite) {
    writeFile("src", "new");
    writeFile("dst", "old");
    KovFile src(Utf8Text(at("src")));
    const int before = fs_.changeCalls;
    EXPECT_FALSE(src.copyTo(at("dst"), false));
    EXPECT_EQ(fs_.changeCalls, before);
    EXPECT_EQ(readFile("src"), "new");
    EXPECT_EQ(readFile("dst"), "old");
}

TEST_F(Support, CopyingOntoAnExistingFileWithOverwrite) {
    writeFile("src", "new content");
    writeFile("dst", "old");
    KovFile src(Utf8Text(at("src")));
    EXPECT_TRUE(src.copyTo(Utf8Text(at("dst")), true));
    EXPECT_EQ(readFile("dst"), "new content");
    EXPECT_EQ(readFile("src"), "new content");
}

TEST_F(Support, CopyingCreatesTheDestinationsParent) {
    writeFile("src", "abc");
    EXPECT_TRUE(KovFile(Utf8Text(at("src"))).copyTo(at("n/m/copy"), false));
    EXPECT_EQ(readFile("n/m/copy"), "abc");
}

TEST_F(Support, CopyingAFileOntoItselfLeavesItWhole) {
    writeFile("self", "keep me");
    EXPECT_FALSE(KovFile(Utf8Text(at("self"))).copyTo(at("self"), true));
    EXPECT_EQ(readFile("self"), "keep me");
}

TEST_F(Support, CopyingADirectoryTree) {
    makeDir("tree");
    makeDir("tree/sub");
    writeFile("tree/a", "A");
    writeFile("tree/sub/b", "B");
    KovDirectory tree(at("tree"), 1, false);
    ASSERT_TRUE(tree.copyTo(at("copy"), false));
    EXPECT_EQ(readFile("copy/a"), "A");
    EXPECT_EQ(readFile("copy/sub/b"), "B");
    EXPECT_EQ(readFile("tree/sub/b"), "B");
    // A file object on a directory copies it as a tree too.
    ASSERT_TRUE(KovFile(Utf8Text(at("tree"))).copyTo(Utf8Text(at("copy2")), false));
    EXPECT_EQ(readFile("copy2/sub/b"), "B");
}

TEST_F(Support, CopyingADirectoryIntoItselfIsRefused) {
    makeDir("tree");
    writeFile("tree/a", "A");
    EXPECT_FALSE(KovDirectory(at("tree"), 1, false).copyTo(at("tree/inner"), false));
    EXPECT_FALSE(present("tree/inner"));
}

// ---- moving ----

TEST_F(Support, MovingWithinADeviceRenames) {
    writeFile("from", "payload");
    KovFile f(Utf8Text(at("from")));
    ASSERT_TRUE(f.moveTo(at("sub/to"), false));
    EXPECT_EQ(fs_.moveCalls, 1);
    EXPECT_FALSE(present("from"));
    EXPECT_EQ(readFile("sub/to"), "payload");
    EXPECT_EQ(f.path(2), at("sub/to"));
    EXPECT_TRUE(f.exists());
    EXPECT_EQ(f.size(), 7);
}

TEST_F(Support, MovingOntoAnExistingFile) {
    writeFile("from", "1");
    writeFile("to", "2");
    KovFile f(Utf8Text(at("from")));
    EXPECT_FALSE(f.moveTo(at("to"), false));
    EXPECT_EQ(f.path(2), at("from"));
    EXPECT_EQ(readFile("to"), "2");
    EXPECT_TRUE(f.moveTo(at("to"), true));
    EXPECT_EQ(readFile("to"), "1");
    EXPECT_FALSE(present("from"));
}

TEST_F(Support, MovingAcrossDevicesCopiesThenDeletes) {
    writeFile("from", "payload");
    makeDir("other");
    fs_.otherDevicePrefix = at("other");
    KovFile f(Utf8Text(at("from")));
    ASSERT_TRUE(f.moveTo(Utf8Text(at("other/to")), false));
    EXPECT_EQ(fs_.moveCalls, 0);
    EXPECT_FALSE(present("from"));
    EXPECT_EQ(readFile("other/to"), "payload");
    EXPECT_EQ(f.path(2), at("other/to"));
}

TEST_F(Support, MovingFallsBackToCopyWhenTheRenameFails) {
    makeDir("d");
    writeFile("d/x", "X");
    fs_.refuseMoves = true;
    KovDirectory d(at("d"), 1, false);
    ASSERT_TRUE(d.moveTo(at("e"), false));
    EXPECT_EQ(fs_.moveCalls, 1);
    EXPECT_FALSE(present("d"));
    EXPECT_EQ(readFile("e/x"), "X");
    EXPECT_EQ(d.path(2), at("e"));
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"x"}));
}

TEST_F(Support, AFailedMoveLeavesTheObjectOnItsSource) {
    writeFile("from", "1");
    writeFile("blocker", "b");  // a file where the destination's parent should be
    fs_.refuseMoves = true;
    KovFile f(Utf8Text(at("from")));
    EXPECT_FALSE(f.moveTo(at("blocker/to"), false));
    EXPECT_EQ(f.path(2), at("from"));
    EXPECT_EQ(readFile("from"), "1");
}

// ---- listing ----

TEST_F(Support, ListingHoldsNeitherDotNorDotDot) {
    writeFile("a", "");
    makeDir("b");
    KovDirectory d(root_, 1, false);
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"a", "b"}));
    for (const KovFile& e : listed) {
        EXPECT_EQ(e.info()->exists_, 1);
        EXPECT_EQ(e.info()->parent_, d.info());
        EXPECT_EQ(e.info()->kind_,
                  e.name().bytes() == "b" ? FileInfo::kDirectory : FileInfo::kFile);
    }
}

TEST_F(Support, ListingIsReadAgainInTheSameSecond) {
    writeFile("first", "");
    fs_.fixedNow = 2000000000;
    setModificationTime("", fs_.fixedNow - 10);
    KovDirectory d(root_, 1, false);
    ASSERT_TRUE(d.readEntries());
    EXPECT_EQ(fs_.listCalls, 1);
    writeFile("second", "");
    setModificationTime("", fs_.fixedNow);  // the same second as the listing
    ASSERT_TRUE(d.readEntries());
    EXPECT_EQ(fs_.listCalls, 2);
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"first", "second"}));
}

TEST_F(Support, ListingIsKeptWhileTheDirectoryIsOlder) {
    writeFile("first", "");
    fs_.fixedNow = 2000000000;
    KovDirectory d(root_, 1, false);
    ASSERT_TRUE(d.readEntries());
    writeFile("second", "");
    setModificationTime("", fs_.fixedNow - 1);
    ASSERT_TRUE(d.readEntries());
    EXPECT_EQ(fs_.listCalls, 1);
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"first"}));
    setModificationTime("", fs_.fixedNow + 5);
    listed.clear();
    ASSERT_TRUE(d.entries(listed));
    EXPECT_EQ(names(listed), (std::set<std::string>{"first", "second"}));
}

TEST_F(Support, PatternListings) {
    writeFile("a.dat", "");
    writeFile("b.dat", "");
    writeFile("c.txt", "");
    writeFile("dat", "");
    KovDirectory d(root_, 1, false);
    std::vector<KovFile> out{KovFile(Utf8Text("kept"))};
    ASSERT_TRUE(d.entries(out, "\\.dat$"));
    ASSERT_EQ(out.size(), 3u);  // appended after what was there
    EXPECT_EQ(out[0].name().bytes(), "kept");
    out.erase(out.begin());
    EXPECT_EQ(names(out), (std::set<std::string>{"a.dat", "b.dat"}));
    out.clear();
    ASSERT_TRUE(d.entries(out, ".*"));
    EXPECT_EQ(out.size(), 4u);
    out.clear();
    ASSERT_TRUE(d.entries(out, "^[ab]"));
    EXPECT_EQ(names(out), (std::set<std::string>{"a.dat", "b.dat"}));
    out.clear();
    ASSERT_TRUE(d.entries(out, "dat"));  // a match anywhere in the name
    EXPECT_EQ(out.size(), 3u);
    out.clear();
    EXPECT_FALSE(d.entries(out, "(unclosed"));
    EXPECT_TRUE(out.empty());
    EXPECT_FALSE(KovDirectory(at("none"), 1, false).entries(out, "x"));
}

// ---- streams ----

TEST_F(Support, OpeningWritingAndReading) {
    KovFile f(Utf8Text(at("s.bin")));
    EXPECT_FALSE(f.open(std::ios::in));  // input needs an existing file
    ASSERT_TRUE(f.open(std::ios::out | std::ios::binary));
    *f.stream() << "12345";
    EXPECT_TRUE(f.open(std::ios::in));  // already open
    EXPECT_TRUE(f.close());
    EXPECT_EQ(f.stream(), nullptr);
    EXPECT_FALSE(f.close());
    EXPECT_EQ(f.size(), 5);
    ASSERT_TRUE(f.open(std::ios::in | std::ios::binary));
    std::string text;
    *f.stream() >> text;
    EXPECT_EQ(text, "12345");
}

TEST_F(Support, OpeningADirectoryFails) {
    makeDir("d");
    KovFile f(Utf8Text(at("d")));
    EXPECT_FALSE(f.open(std::ios::out));
}

TEST_F(Support, AStdioHandleBlocksOpeningAndIsClosed) {
    writeFile("h", "x");
    KovFile f(Utf8Text(at("h")));
    std::FILE* handle = std::fopen(at("h").c_str(), "rb");
    ASSERT_NE(handle, nullptr);
    f.adoptStdio(handle);
    EXPECT_FALSE(f.open(std::ios::in));
    EXPECT_TRUE(f.close());
    EXPECT_TRUE(f.open(std::ios::in));
}

// ---- failures: false or 0, never an exception ----

// Runs every operation on `path` and expects each to report failure.
void expectEveryOperationFails(const std::string& path, const std::string& destination) {
    SCOPED_TRACE(path.substr(0, 80));
    KovFile f(Utf8Text(path), 0, false);
    EXPECT_FALSE(f.exists());
    EXPECT_EQ(f.size(), 0);
    EXPECT_EQ(f.modificationTime(), 0);
    EXPECT_EQ(f.accessTime(), 0);
    EXPECT_EQ(f.creationTime(), 0);
    EXPECT_FALSE(f.refresh(true));
    EXPECT_FALSE(f.open(std::ios::in));
    EXPECT_FALSE(f.copyTo(destination, true));
    EXPECT_FALSE(f.moveTo(destination, true));
    EXPECT_TRUE(f.remove());  // nothing to remove is not a failure

    KovDirectory d(path, 0, false);
    EXPECT_FALSE(d.exists());
    EXPECT_FALSE(d.readEntries());
    std::vector<KovFile> out;
    EXPECT_FALSE(d.entries(out));
    EXPECT_FALSE(d.entries(out, "x"));
    EXPECT_TRUE(out.empty());
    EXPECT_FALSE(d.contains(Utf8Text("x")));
    EXPECT_FALSE(d.remove());
    EXPECT_FALSE(d.copyTo(destination, true));
    EXPECT_FALSE(d.moveTo(destination, true));
}

TEST_F(Support, PathUnderARegularFileFails) {
    writeFile("file", "x");
    expectEveryOperationFails(at("file/child"), at("dest"));
    EXPECT_FALSE(KovFile(Utf8Text(at("file/child"))).create());
    EXPECT_FALSE(KovDirectory(at("file/child"), 1, false).create());
    EXPECT_EQ(readFile("file"), "x");
    EXPECT_FALSE(present("dest"));
}

TEST_F(Support, MissingParentFails) {
    expectEveryOperationFails(at("no/such/file"), at("dest"));
    EXPECT_FALSE(present("dest"));
    EXPECT_FALSE(present("no"));
}

TEST_F(Support, EmptyPathFails) {
    expectEveryOperationFails("", at("dest"));
    EXPECT_FALSE(KovFile(Utf8Text("")).create());
    EXPECT_FALSE(KovDirectory("", 1, false).create());
    EXPECT_EQ(KovFile(Utf8Text("")).path(2), "");
    EXPECT_EQ(KovDirectory("", 1, false).rootKind(), 0);
    // Nothing may be copied or moved onto an empty path either.
    writeFile("src", "x");
    EXPECT_FALSE(KovFile(Utf8Text(at("src"))).copyTo(std::string(), true));
    EXPECT_FALSE(KovFile(Utf8Text(at("src"))).moveTo(std::string(), true));
    EXPECT_EQ(readFile("src"), "x");
}

TEST_F(Support, PathOfOnlySeparatorsIsTheRootAndIsNeverChanged) {
    fs_.refuseAllChanges = true;  // a safety net: nothing may be touched
    KovDirectory d("///", 1, false);
    EXPECT_EQ(d.path(2), "/");
    EXPECT_TRUE(d.exists());
    EXPECT_FALSE(d.remove());
    EXPECT_FALSE(d.copyTo(at("dest"), false));
    EXPECT_FALSE(d.moveTo(at("dest"), false));
    KovFile f(Utf8Text("//"));
    EXPECT_TRUE(f.create());  // the root exists (a directory): nothing to make
    EXPECT_FALSE(f.open(std::ios::out));
    EXPECT_FALSE(f.copyTo(at("dest"), false));
    EXPECT_EQ(fs_.changeCalls, 0);
}

TEST_F(Support, PathOfFiveThousandCharactersFails) {
    const std::string longPath = at(std::string(5000, 'n'));
    expectEveryOperationFails(longPath, at("dest"));
    EXPECT_FALSE(KovFile(Utf8Text(longPath)).create());
    EXPECT_FALSE(KovDirectory(longPath, 1, false).create());
    writeFile("src", "x");
    EXPECT_FALSE(KovFile(Utf8Text(at("src"))).copyTo(longPath, true));
    EXPECT_FALSE(KovFile(Utf8Text(at("src"))).moveTo(longPath, true));
    EXPECT_EQ(readFile("src"), "x");
}

TEST_F(Support, NamesThatAreNotUtf8FailWhenMissing) {
    expectEveryOperationFails(at("bad\xFF\xFE"
                                 "name"),
                              at("dest"));
    expectEveryOperationFails(at("\xC0\xAF/child"), at("dest"));
}

TEST_F(Support, NamesThatAreNotUtf8AreKeptAsTheirBytes) {
    const std::string name =
        "bad\xFF\xFE"
        "name";
    KovFile f(Utf8Text(at(name)));
    ASSERT_TRUE(f.create());
    EXPECT_TRUE(present(name));
    EXPECT_EQ(f.path(2), at(name));
    KovDirectory d(root_, 1, false);
    EXPECT_TRUE(d.contains(Utf8Text(name)));
    std::vector<KovFile> listed;
    ASSERT_TRUE(d.entries(listed, "name$"));
    EXPECT_EQ(names(listed), (std::set<std::string>{name}));
    EXPECT_TRUE(f.remove());
    EXPECT_FALSE(present(name));
}

}  // namespace
