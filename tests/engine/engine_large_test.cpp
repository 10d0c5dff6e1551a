// A run of the engine binding well past its page cache: about 100 MB of
// 4 KiB values under integer keys, with the engine opened the way the store
// opens it and its temporary directory pointed at a scratch directory made
// here. Checks that the spilled temporary file lives in that directory,
// already unlinked, while the engine is open; that nothing is left open or
// on disk there after Close; and that every record reads back intact.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <random>
#include <string>
#include <system_error>
#include <vector>

#include "engine/btree.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"
#include "host_util.h"
#include "scratch_directory.h"

namespace {

namespace fs = std::filesystem;
using namespace kov::engine;        // NOLINT(google-build-using-namespace)
using namespace kov::engine::test;  // NOLINT(google-build-using-namespace)

constexpr std::int64_t kRecords = 25600;  // 25 600 x 4 KiB = 100 MiB
constexpr std::size_t kValueSize = 4096;

// The value stored under `key` in `generation` (0 = first insert, 1 = the
// replacement): the key's bytes, then bytes of a generator seeded by both.
void fillValue(std::int64_t key, int generation, std::string& out) {
    out.resize(kValueSize);
    std::uint64_t x = static_cast<std::uint64_t>(key) * 0x9E3779B97F4A7C15ull +
                      static_cast<std::uint64_t>(generation + 1) * 0xD1B54A32D192ED03ull;
    std::memcpy(out.data(), &key, sizeof key);
    for (std::size_t i = sizeof key; i + 8 <= kValueSize; i += 8) {
        x ^= x << 13;
        x ^= x >> 7;
        x ^= x << 17;
        std::memcpy(out.data() + i, &x, 8);
    }
}

// The targets of this process's open file descriptors that lie in `dir`,
// as the kernel shows them (a deleted file's target ends in " (deleted)").
// Empty where the system has no /proc/self/fd.
std::vector<std::string> openFilesIn(const fs::path& dir) {
    std::vector<std::string> found;
    const std::string prefix = dir.string() + "/";
    std::error_code ec;
    for (fs::directory_iterator it("/proc/self/fd", ec), end; !ec && it != end; it.increment(ec)) {
        std::error_code linkEc;
        fs::path target = fs::read_symlink(it->path(), linkEc);
        if (linkEc)
            continue;
        const std::string t = target.string();
        if (t.compare(0, prefix.size(), prefix) == 0)
            found.push_back(t);
    }
    return found;
}

// Whether this process's open files can be seen under /proc/self/fd. The
// build says where that cannot be so (KOV_TEST_PROC_FD is 0 for Windows:
// under Wine, drive Z: shows the Unix /proc, whose entries are the Wine
// processes' descriptors and never name the program's own handles); where
// it may be, the directory itself is asked.
bool haveProcFd() {
    if (KOV_TEST_PROC_FD == 0)
        return false;
    std::error_code ec;
    return fs::is_directory("/proc/self/fd", ec);
}

bool endsWith(const std::string& s, const std::string& tail) {
    return s.size() >= tail.size() && s.compare(s.size() - tail.size(), tail.size(), tail) == 0;
}

TEST(EngineLarge, RunPastTheCacheSpillsIntoTheTemporaryDirectoryAndReadsBack) {
    const kov::test::ScratchDirectory scratch("kovpager-engine-large-");
    ASSERT_FALSE(scratch.path().empty()) << "could not make a scratch directory";
    // Resolved, as the targets of /proc/self/fd are.
    const fs::path dir = fs::canonical(scratch.path());
    const auto entries = [&dir] { return kov::test::entriesOf(dir.string()); };
    const bool procFd = haveProcFd();
    if (procFd) {
        ASSERT_TRUE(openFilesIn(dir).empty());
    }

    {
        TempDirSetting setting(dir.string());
        TestEngine engine;  // the store's settings, BeginTrans(2)
        ASSERT_EQ(engine.openRc, SQLITE_OK);
        ASSERT_NE(engine.get(), nullptr);
        ASSERT_EQ(engine.pageSizeRc, SQLITE_OK);
        ASSERT_EQ(engine.cacheSizeRc, SQLITE_OK);
        ASSERT_EQ(engine.beginRc, SQLITE_OK);
        std::uint32_t root = engine.createTable(kIntTable);
        ASSERT_NE(root, 0u);

        std::string value;
        {
            TestCursor w(engine.get(), root, 1);
            ASSERT_EQ(w.rc, SQLITE_OK);
            for (std::int64_t k = 0; k < kRecords; ++k) {
                fillValue(k, 0, value);
                ASSERT_EQ(insertInt(w.get(), k, value), SQLITE_OK) << "key " << k;
            }
            // Replace every 97th record, far behind the cache's reach.
            for (std::int64_t k = 0; k < kRecords; k += 97) {
                fillValue(k, 1, value);
                ASSERT_EQ(insertInt(w.get(), k, value), SQLITE_OK) << "key " << k;
            }
        }

        // The data is far larger than the cache, so the temporary file exists
        // by now: open in the scratch directory and already unlinked from it.
        if (procFd) {
            std::vector<std::string> open = openFilesIn(dir);
            ASSERT_FALSE(open.empty()) << "no temporary file open in " << dir;
            for (const auto& target : open)
                EXPECT_TRUE(endsWith(target, " (deleted)")) << target;
            EXPECT_TRUE(entries().empty())
                << "the temporary file is still linked: " << entries().front();
        } else if (KOV_TEST_PROC_FD == 0) {
            // Windows: the file is opened to be deleted when closed, and its
            // name stays in the directory until then.
            EXPECT_FALSE(entries().empty()) << "no temporary file in " << dir;
        }

        // Every record, in key order.
        TestCursor r(engine.get(), root, 0);
        ASSERT_EQ(r.rc, SQLITE_OK);
        std::string expected;
        std::string got(kValueSize, '\0');
        int res = 1;
        ASSERT_EQ(sqlite3BtreeFirst(r.get(), &res), SQLITE_OK);
        for (std::int64_t k = 0; k < kRecords; ++k) {
            ASSERT_EQ(res, 0) << "walk ended before key " << k;
            std::int64_t key = -1;
            ASSERT_EQ(sqlite3BtreeKeySize(r.get(), &key), SQLITE_OK);
            ASSERT_EQ(key, k);
            std::uint32_t size = 0;
            ASSERT_EQ(sqlite3BtreeDataSize(r.get(), &size), SQLITE_OK);
            ASSERT_EQ(size, kValueSize) << "key " << k;
            ASSERT_EQ(sqlite3BtreeData(r.get(), 0, size, got.data()), SQLITE_OK) << "key " << k;
            fillValue(k, k % 97 == 0 ? 1 : 0, expected);
            ASSERT_TRUE(got == expected) << "data of key " << k;
            ASSERT_EQ(sqlite3BtreeNext(r.get(), &res), SQLITE_OK);
        }
        EXPECT_EQ(res, 1) << "more entries than inserted";

        // Random seeks across the whole file, each followed by a read.
        std::mt19937_64 rng(99);
        for (int i = 0; i < 2000; ++i) {
            std::int64_t k = static_cast<std::int64_t>(rng() % kRecords);
            ASSERT_EQ(seekInt(r.get(), k), 0) << "key " << k;
            ASSERT_EQ(currentIntKey(r.get()), k);
            ASSERT_EQ(sqlite3BtreeData(r.get(), 0, kValueSize, got.data()), SQLITE_OK);
            fillValue(k, k % 97 == 0 ? 1 : 0, expected);
            ASSERT_TRUE(got == expected) << "data of key " << k;
        }
        EXPECT_LT(seekInt(r.get(), kRecords), 0);
        EXPECT_EQ(currentIntKey(r.get()), kRecords - 1);

        // SQLite's own check of every page of the file.
        EXPECT_EQ(integrityProblems(engine.get()), "");

        ASSERT_EQ(r.close(), SQLITE_OK);
        EXPECT_EQ(engine.close(), SQLITE_OK);
    }

    // Nothing open there and nothing left behind.
    if (procFd) {
        std::vector<std::string> open = openFilesIn(dir);
        EXPECT_TRUE(open.empty()) << "still open after Close: " << open.front();
    }
    std::vector<std::string> left = entries();
    EXPECT_TRUE(left.empty()) << "left in the temporary directory: " << left.front();
}

}  // namespace
