// The pager's end of life: cursors left registered after reset, and the exit-time teardown.
// Each test here ends with the teardown (registry emptied, engine closed, directory setting
// cleared), so they live apart from the other store tests.
#include <gtest/gtest.h>

#include <memory>

#include "engine/btree.h"
#include "pager_test_util.h"

using namespace kovtest;

TEST(PagerTeardown, ResetThenDestroyingACursorLeavesItsSlotLive) {
    KovPager::instance()->reset();
    {
        KovBtree t(KovBtree::IntKeyTable);
        ASSERT_TRUE(KovTestAccess::slots().empty());
        KovBtreeCursor c(t, true);
        insertInt(c, 1, "one");
        KovPager::instance()->reset();
        EXPECT_EQ(KovTestAccess::engine(), nullptr);
        // The cursor is inert: it answers "no entry".
        EXPECT_FALSE(c.first());
        EXPECT_FALSE(c.good());
        EXPECT_EQ(intKey(c), 0);
        EXPECT_LT(c.seek(std::int64_t{1}), 0);
        insertInt(c, 2, "refused");
    }
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_NE(KovTestAccess::slots()[0].rootPage, kFreeSlot);
    EXPECT_NE(KovTestAccess::slots()[0].cursor, nullptr);

    // A later table creation saves and closes the stale cursor, then reopens the slot in the new
    // engine: the slot stays live, and nothing leaks.
    KovBtree fresh(KovBtree::IntKeyTable);
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_NE(KovTestAccess::slots()[0].rootPage, kFreeSlot);
    KovBtreeCursor reader(fresh, false);
    EXPECT_FALSE(reader.first());

    KovTestAccess::teardown();
    EXPECT_TRUE(KovTestAccess::slots().empty());
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
}

TEST(PagerTeardown, TeardownClosesEverythingAndLaterHostObjectsDoNothing) {
    auto table = std::make_unique<KovBtree>(KovBtree::BlobTable);
    auto writer = std::make_unique<KovBtreeCursor>(*table, true);
    insertBytes(*writer, "k", "v");
    auto reader = std::make_unique<KovBtreeCursor>(*table, false);
    ASSERT_TRUE(reader->first());
    ASSERT_FALSE(KovTestAccess::slots().empty());

    KovTestAccess::teardown();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    EXPECT_TRUE(KovTestAccess::slots().empty());
    EXPECT_EQ(KovTestAccess::slots().capacity(), 0u);
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), nullptr);
    EXPECT_TRUE(KovTestAccess::tempDir(KovPager::instance()).empty());

    // Host objects that outlive the teardown find no engine and no slot: every operation reports
    // "no entry" and destruction does nothing.
    EXPECT_FALSE(reader->good());
    EXPECT_FALSE(reader->first());
    EXPECT_EQ(intKey(*reader), 0);
    std::string payload = "kept";
    EXPECT_FALSE(reader->indexKeyFetch("k", 1, payload));
    EXPECT_EQ(payload, "kept");
    reader.reset();
    writer.reset();
    table.reset();
    EXPECT_TRUE(KovTestAccess::slots().empty());
    EXPECT_EQ(KovTestAccess::engine(), nullptr);

    // Teardown twice is harmless.
    KovTestAccess::teardown();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
}

// A slot registered on a byte-string table before a reset can be reopened, in the new engine, on
// an integer-keyed table with the same root page. Saving its position must not take the integer
// key for a key length (which would ask for a string of that many bytes).
TEST(PagerTeardown, StaleByteSlotOnAnIntegerTableSavesAnEmptyKey) {
    std::uint32_t oldRoot = 0;
    KovPager::instance()->reset();
    {
        KovBtree blobs(KovBtree::BlobTable);
        oldRoot = KovTestAccess::rootPage(blobs);
        KovBtreeCursor stale(blobs, false);
        KovPager::instance()->reset();
    }  // the slot stays live, with byte-string flags
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_EQ(KovTestAccess::slots()[0].tableFlags, 0u);

    KovBtree ints(KovBtree::IntKeyTable);  // a fresh engine: the first table gets the same root
    ASSERT_EQ(KovTestAccess::rootPage(ints), oldRoot);
    {
        KovBtreeCursor w(ints, true);
        insertInt(w, INT64_C(1) << 50, "far");
    }
    {
        KovBtree second(KovBtree::BlobTable);  // the stale slot is searched onto key 2^50
    }
    std::vector<std::string> saved;
    KovTestAccess::closeAllCursors(saved);
    ASSERT_EQ(saved.size(), 1u);
    EXPECT_EQ(saved[0], "");
    KovTestAccess::restoreAllCursors(saved);
    KovBtree third(KovBtree::IndexTable);
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);
    KovTestAccess::teardown();
}
