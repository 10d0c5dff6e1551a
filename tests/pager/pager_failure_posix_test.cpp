// KovPager::failed() and failure() when the temporary directory exists but cannot take a file:
// /proc, a directory that even root cannot create a file in, stands for a read-only file system.
// The failure is met when the file is first wanted (the store could outgrow half its cache), long
// after the directory was chosen.
#include <gtest/gtest.h>

#include <cstdint>
#include <string>

#include "engine/btree.h"
#include "pager_test_util.h"

using namespace kovtest;

// The store reset, with no cursor left (StoreTest), for each test of this file.
class PagerFailurePosix : public kovtest::StoreTest {};

TEST_F(PagerFailurePosix, TemporaryDirectoryThatCannotTakeAFile) {
    {
        // Inserts straight into the B-tree: each one meets the missing file itself.
        kov::engine::test::ScopedLoadLimits straight{kov::engine::test::kStraightLoads};
        TempDirOverride proc("/proc");
        KovPager::instance()->reset();
        KovBtree table(KovBtree::IntKeyTable);
        // A cache of 200 pages: the file is wanted after a few hundred records, not after 64 MiB.
        kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), 200);
        KovBtreeCursor c(table, true);
        const std::int64_t k = insertUntilFailed(c, 1000);
        ASSERT_TRUE(KovPager::instance()->failed()) << "no file was ever wanted";
        EXPECT_GT(k, 50);
        const std::string text = KovPager::instance()->failure();
        EXPECT_NE(text.find("while inserting an entry"), std::string::npos) << text;
        EXPECT_NE(text.find("unable to open database file"), std::string::npos) << text;
        EXPECT_NE(text.find("cannot make a file in /proc: "), std::string::npos) << text;
        EXPECT_NE(text.find("temporary directory: /proc."), std::string::npos) << text;
        // Everything inserted before reads back; writes are refused from here on.
        std::int64_t n = 0;
        for (bool on = c.first(); on; on = c.next())
            ++n;
        EXPECT_EQ(n, k - 1);
        c.insert(-1, "x", 1);
        EXPECT_NE(c.seek(std::int64_t{-1}), 0);
    }
    KovPager::instance()->reset();
    EXPECT_FALSE(KovPager::instance()->failed());
    EXPECT_EQ(KovPager::instance()->failure(), "");
}
