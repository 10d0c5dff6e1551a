// The store's temporary file on POSIX: made only in the chosen directory, readable and writable
// by the process's user only, unlinked at once; a directory that cannot take it is a failure the
// host is told of, and nothing is made anywhere else; a file system that fills up refuses the
// insert that needed room and loses nothing. Small file systems are real ones (tmpfs, mounted by
// the test when it runs as root, as .ci/run does); the tests that need one are skipped otherwise.
#include <gtest/gtest.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include "host_util.h"
#include "pager_test_util.h"
#include "scratch_directory.h"

using namespace kovtest;

namespace {

// The process's open descriptors: number and target.
std::vector<std::pair<std::string, std::string>> openFiles() {
    std::vector<std::pair<std::string, std::string>> files;
    for (const std::string& fd : kov::test::entriesOf("/proc/self/fd")) {
        char buffer[4096];
        const std::string link = "/proc/self/fd/" + fd;
        const ssize_t n = readlink(link.c_str(), buffer, sizeof buffer - 1);
        if (n > 0)
            files.emplace_back(link, std::string(buffer, static_cast<std::size_t>(n)));
    }
    return files;
}

// Descriptors on a temporary file of the store's (or of SQLite's own naming), wherever it is.
std::vector<std::pair<std::string, std::string>> storeFiles() {
    std::vector<std::pair<std::string, std::string>> found;
    for (const auto& file : openFiles()) {
        if (contains(file.second, "/kovpager_") || contains(file.second, "etilqs_"))
            found.push_back(file);
    }
    return found;
}

// A tmpfs of its own for one test, mounted on a scratch directory (root only); unmounted and
// removed on destruction. why() says why there is none.
class SmallFileSystem {
  public:
    SmallFileSystem(const std::string& options, bool readOnly) : scratch_("kov-small-fs-") {
        if (scratch_.path().empty()) {
            why_ = "no scratch directory";
        } else if (geteuid() != 0) {
            why_ = "mounting a tmpfs needs root";
        } else if (::mount("tmpfs", scratch_.path().c_str(), "tmpfs", readOnly ? MS_RDONLY : 0,
                           options.c_str()) != 0) {
            why_ = std::string("mount: ") + std::strerror(errno);
        } else {
            mounted_ = true;
        }
    }
    ~SmallFileSystem() {
        if (mounted_)
            ::umount2(scratch_.path().c_str(), MNT_DETACH);
    }
    SmallFileSystem(const SmallFileSystem&) = delete;
    SmallFileSystem& operator=(const SmallFileSystem&) = delete;

    bool mounted() const { return mounted_; }
    const std::string& why() const { return why_; }
    const std::string& path() const { return scratch_.path(); }
    std::uint64_t freeBytes() const {
        struct statvfs fs {};
        if (::statvfs(path().c_str(), &fs) != 0)
            return 0;
        return static_cast<std::uint64_t>(fs.f_bavail) * fs.f_frsize;
    }

  private:
    kov::test::ScratchDirectory scratch_;
    bool mounted_ = false;
    std::string why_;
};

std::int64_t countEntries(KovBtreeCursor& c) {
    std::int64_t n = 0;
    for (bool on = c.first(); on; on = c.next())
        ++n;
    return n;
}

}  // namespace

// The store reset, with no cursor left (StoreTest), for each test of this file.
class PagerTempFile : public kovtest::StoreTest {};

// Past a small cache the file exists: in the chosen directory and nowhere else, already unlinked
// from it (the directory lists nothing), readable and writable by the process's user only.
TEST_F(PagerTempFile, TemporaryFileIsMadeOnlyInTheChosenDirectoryForItsUserAlone) {
    kov::test::ScratchDirectory scratch("kov-temp-file-");
    ASSERT_FALSE(scratch.path().empty());
    ASSERT_TRUE(storeFiles().empty());
    {
        TempDirOverride dir(scratch.path());
        KovPager::instance()->reset();
        KovBtree table(KovBtree::IntKeyTable);
        kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), 10);
        KovBtreeCursor c(table, true);
        const std::string data(1000, 'd');
        for (std::int64_t k = 0; k < 200; ++k)
            c.insert(k, data.data(), data.size());
        const auto files = storeFiles();
        ASSERT_EQ(files.size(), 1u);
        EXPECT_EQ(files[0].second.rfind(scratch.path() + "/kovpager_", 0), 0u) << files[0].second;
        EXPECT_TRUE(contains(files[0].second, " (deleted)")) << files[0].second;
        EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
        struct stat st {};
        ASSERT_EQ(::stat(files[0].first.c_str(), &st), 0);
        EXPECT_EQ(st.st_mode & 07777, static_cast<mode_t>(0600));
        EXPECT_EQ(st.st_uid, geteuid());
        EXPECT_EQ(countEntries(c), 200);
        EXPECT_FALSE(KovPager::instance()->failed());
    }
    KovPager::instance()->reset();
    EXPECT_TRUE(storeFiles().empty());
}

// A directory that cannot take a file (a read-only file system when the test runs as root, a
// directory without write permission otherwise): the insert that needed the file is refused and
// the host is told why and where; no file of the store's is made in any other directory; every
// entry inserted before reads back; reset() gives a store that works while it needs no file.
TEST_F(PagerTempFile, ReadOnlyTemporaryDirectoryIsToldAndNothingIsMadeElsewhere) {
    SmallFileSystem readOnly("size=1m", true);
    kov::test::ScratchDirectory fallback("kov-no-write-");
    std::string dir = readOnly.path();
    std::string reason = "Read-only file system";
    if (!readOnly.mounted()) {
        if (geteuid() == 0)
            GTEST_SKIP() << "no read-only file system for root: " << readOnly.why();
        ASSERT_FALSE(fallback.path().empty());
        ASSERT_EQ(::chmod(fallback.path().c_str(), 0555), 0);
        dir = fallback.path();
        reason = "Permission denied";
    }
    ASSERT_TRUE(storeFiles().empty());
    {
        TempDirOverride over(dir);
        KovPager::instance()->reset();
        KovBtree ints(KovBtree::IntKeyTable);
        KovBtree bytes(KovBtree::BlobTable);
        // A cache of 200 pages: the file is wanted after a few hundred records, not after 64 MiB.
        kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), 200);
        KovBtreeCursor c(ints, true);
        KovBtreeCursor b(bytes, true);
        insertBytes(b, "kept", "before");
        const std::int64_t k = insertUntilFailed(c, 1000);
        ASSERT_TRUE(KovPager::instance()->failed()) << "no file was ever wanted";
        EXPECT_GT(k, 50);
        const std::string text = KovPager::instance()->failure();
        EXPECT_TRUE(contains(text, "while inserting an entry: unable to open database file "
                                   "(SQLite result code 14): cannot make a file in " +
                                       dir + ": " + reason + "; temporary directory: " + dir +
                                       "."))
            << text;
        EXPECT_TRUE(storeFiles().empty());
        EXPECT_TRUE(kov::test::entriesOf(dir).empty());
        // Every entry inserted before the refused one reads back; writes stay refused.
        EXPECT_EQ(countEntries(c), k - 1);
        EXPECT_EQ(walkBytes(b), (std::vector<std::pair<std::string, std::string>>{{"kept", "before"}}));
        c.insert(-1, "x", 1);
        EXPECT_NE(c.seek(std::int64_t{-1}), 0);
    }
    ::chmod(fallback.path().c_str(), 0755);
    KovPager::instance()->reset();
    EXPECT_FALSE(KovPager::instance()->failed());
}

namespace {

// The case a new user meets: a file system of 24 MiB named for the store, a table of 20 000
// integer keys filled first, then 200-byte entries inserted into a byte-string table until the
// store says it failed. Every entry inserted before reads back, in both tables; reads, walks and
// seeks go on; inserts stay refused; reset() gives the space back and a store that works.
void fillASmallFileSystem(int cachePages) {
    SmallFileSystem small("size=24m,mode=0700", false);
    if (!small.mounted())
        GTEST_SKIP() << "no small file system: " << small.why();
    const std::uint64_t emptyFree = small.freeBytes();
    {
        TempDirOverride over(small.path());
        KovPager::instance()->reset();
        KovBtree ints(KovBtree::IntKeyTable);
        KovBtree bytes(KovBtree::BlobTable);
        if (cachePages > 0)
            kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), cachePages);
        KovBtreeCursor i(ints, true);
        KovBtreeCursor b(bytes, true);
        for (std::int64_t k = 0; k < 20000; ++k) {
            const std::string v = "int " + std::to_string(k);
            i.insert(k, v.data(), v.size());
        }
        ASSERT_FALSE(KovPager::instance()->failed()) << KovPager::instance()->failure();
        auto keyOf = [](std::int64_t n) {
            // Spread over the key space, as a host's keys are.
            const std::uint64_t h = static_cast<std::uint64_t>(n) * 0x9E3779B97F4A7C15ull;
            char buf[24];
            std::snprintf(buf, sizeof buf, "%016llx", static_cast<unsigned long long>(h));
            return std::string(buf);
        };
        auto dataOfKey = [](std::int64_t n) {
            std::string d(200, 'a');
            for (std::size_t j = 0; j < d.size(); j += 7)
                d[j] = static_cast<char>('a' + (n + static_cast<std::int64_t>(j)) % 26);
            return d;
        };
        std::int64_t n = 0;
        for (; n < 2000000 && !KovPager::instance()->failed(); ++n) {
            const std::string key = keyOf(n);
            const std::string data = dataOfKey(n);
            b.insert(key.data(), key.size(), data.data(), data.size());
        }
        ASSERT_TRUE(KovPager::instance()->failed()) << "24 MiB never filled";
        const std::int64_t accepted = n - 1;  // the last one was refused
        const std::string text = KovPager::instance()->failure();
        EXPECT_TRUE(contains(text, "while inserting an entry: database or disk is full (SQLite "
                                   "result code 13): cannot reserve space for the temporary "
                                   "file: No space left on device; temporary directory: " +
                                       small.path() + "."))
            << text;
        std::printf("entries accepted before the disk was full: %lld of 200 bytes\n",
                    static_cast<long long>(accepted));

        // Every entry inserted before the refusal reads back whole, in both tables.
        std::int64_t seen = 0;
        for (bool on = i.first(); on; on = i.next()) {
            ASSERT_EQ(intKey(i), seen);
            ASSERT_EQ(dataOf(i), "int " + std::to_string(seen));
            ++seen;
        }
        EXPECT_EQ(seen, 20000);
        EXPECT_EQ(countEntries(b), accepted);
        for (std::int64_t m = 0; m < accepted; m += 997) {
            ASSERT_EQ(seekBytes(b, keyOf(m)), 0) << m;
            ASSERT_EQ(dataOf(b), dataOfKey(m)) << m;
        }
        ASSERT_EQ(seekBytes(b, keyOf(accepted - 1)), 0);
        EXPECT_EQ(dataOf(b), dataOfKey(accepted - 1));
        // Inserts stay refused, also where there would be room.
        insertInt(i, -5, "refused");
        EXPECT_NE(i.seek(std::int64_t{-5}), 0);
        EXPECT_EQ(countEntries(b), accepted);
    }
    KovPager::instance()->reset();
    EXPECT_FALSE(KovPager::instance()->failed());
    EXPECT_GE(small.freeBytes() + (64u << 10), emptyFree);  // the file gave its room back
    {
        TempDirOverride over(small.path());
        KovBtree again(KovBtree::IntKeyTable);
        KovBtreeCursor c(again, true);
        for (std::int64_t k = 0; k < 1000; ++k)
            insertInt(c, k, std::string(100, 'x'));
        EXPECT_EQ(countEntries(c), 1000);
        EXPECT_FALSE(KovPager::instance()->failed());
    }
    KovPager::instance()->reset();
}

}  // namespace

// With the store's own 64 MiB cache: the file is wanted, and room for what the cache holds asked
// for, once the store could outgrow half its cache; 24 MiB cannot hold that, so the insert that
// wanted it is refused and everything stays in the cache, readable.
TEST_F(PagerTempFile, FullSmallFileSystemLosesNothing) { fillASmallFileSystem(0); }

// With a cache of 100 pages: the pages go through the file, which fills the file system, with
// loads gathered, written in runs and merged on the way.
TEST_F(PagerTempFile, FullSmallFileSystemLosesNothingPastASmallCache) { fillASmallFileSystem(100); }
