// Orders of public calls that the headers advise against, each of which once read freed memory
// or could have: pager copies kept and assigned back, reset() through a copy, tables and cursors
// from before reset() used after a new engine opened, self-assignment. Each keeps its described
// outcome where there is one; what was undefined now has a defined one (KovPager.h), and no
// order reads freed memory, crashes or leaks (the sanitizer pass runs these).
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <new>
#include <string>

#include "engine/btree.h"
#include "pager_test_util.h"

using namespace kovtest;

namespace {

bool engineOpen() { return kov::engine::sqlite3BtreeIsOpen(KovTestAccess::engine()); }

// No two slots name the same engine cursor (each would close it).
void expectDistinctCursors() {
    const auto& slots = KovTestAccess::slots();
    for (std::size_t i = 0; i < slots.size(); ++i) {
        for (std::size_t j = i + 1; j < slots.size(); ++j) {
            if (slots[i].cursor != nullptr) {
                EXPECT_NE(slots[i].cursor, slots[j].cursor) << "slots " << i << " and " << j;
            }
        }
    }
}

// Every test starts on an open engine with an empty registry and ends with the exit-time
// teardown, which frees whatever a test left in the registry.
class CallOrder : public ::testing::Test {
  protected:
    void SetUp() override {
        KovPager::instance()->reset();
        KovBtree opener(KovBtree::IndexTable);
        ASSERT_TRUE(KovTestAccess::slots().empty());
        ASSERT_TRUE(engineOpen());
    }
    void TearDown() override {
        EXPECT_FALSE(KovPager::instance()->failed()) << KovPager::instance()->failure();
        KovTestAccess::teardown();
    }

    // The store still does its work: a table, a writer, an entry read back.
    static void expectStoreWorks() {
        KovBtree table(KovBtree::BlobTable);
        KovBtreeCursor c(table, true);
        insertBytes(c, "key", "value");
        ASSERT_EQ(seekBytes(c, "key"), 0);
        EXPECT_EQ(dataOf(c), "value");
    }
};

}  // namespace

// The order a new user tried under AddressSanitizer: a copy kept while a cursor is open, the
// cursor destroyed, the copy assigned back, a table made. The copy's slot names the destroyed
// cursor's engine cursor, freed since: it comes back without one.
TEST_F(CallOrder, CopyKeptOverACursorsDestructionThenAssignedBack) {
    KovBtree table(KovBtree::IntKeyTable);
    std::unique_ptr<PagerCopy> copy;
    {
        KovBtreeCursor c(table, true);
        c.insert(1, "one", 3);
        copy = std::make_unique<PagerCopy>();  // taken while `c` is open
    }
    *KovPager::instance() = **copy;
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_EQ(KovTestAccess::slots()[0].cursor, nullptr);
    KovBtree other(KovBtree::BlobTable);  // closes and reopens every slot
    EXPECT_TRUE(engineOpen());
    expectStoreWorks();
}

// A copy taken before a table creation names engine cursors that the creation closed. Assigned
// back, a slot keeps only an engine cursor the registry holds now (the allocator may have given
// a reopened cursor the same address, and then it is that one); the others come back without one
// and answer as on no entry, and the engine cursors no slot takes are closed rather than lost.
TEST_F(CallOrder, CopyTakenBeforeATableCreationAssignedBack) {
    KovBtree table(KovBtree::IntKeyTable);
    KovBtreeCursor c(table, true);
    c.insert(7, "seven", 5);
    ASSERT_EQ(c.seek(std::int64_t{7}), 0);
    PagerCopy copy;
    { KovBtree other(KovBtree::IndexTable); }  // `c` is closed and reopened on key 7
    ASSERT_TRUE(c.good());
    *KovPager::instance() = *copy;
    expectDistinctCursors();
    if (KovTestAccess::slots()[0].cursor == nullptr) {
        EXPECT_FALSE(c.good());
        EXPECT_FALSE(c.first());
        EXPECT_EQ(c.dataSize(), 0);
        c.insert(8, "eight", 5);  // no engine cursor: nothing happens
    }
    // The next table creation reopens the slot on its table, on key 7 either way.
    KovBtree another(KovBtree::BlobTable);
    ASSERT_TRUE(c.good());
    EXPECT_EQ(intKey(c), 7);
    expectStoreWorks();
}

// reset() through a copy closes the engine the copy shares with the process's pager, as the
// pager's own reset() would: the store is closed, every cursor made before answers as on no
// entry, and the next table opens a fresh engine.
TEST_F(CallOrder, ResetThroughACopyClosesTheSharedEngine) {
    auto table = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    auto c = std::make_unique<KovBtreeCursor>(*table, true);
    c->insert(1, "one", 3);
    {
        PagerCopy copy;
        copy->reset();
        copy->reset();  // twice: nothing more
    }
    EXPECT_FALSE(engineOpen());
    EXPECT_FALSE(c->first());
    c->insert(2, "two", 3);
    KovPager::instance()->reset();  // the pager's own reset after the copy's: nothing more
    KovBtree fresh(KovBtree::IntKeyTable);
    EXPECT_TRUE(engineOpen());
    c.reset();
    table.reset();
    expectStoreWorks();
}

// A copy taken before reset() holds the old engine; assigned back after a new engine opened, it
// does not bring the old one back: the store keeps its engine, and the copy's slots keep only
// engine cursors the registry holds now.
TEST_F(CallOrder, CopyTakenBeforeResetAssignedBackAfterANewEngine) {
    auto table = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    auto c = std::make_unique<KovBtreeCursor>(*table, true);
    PagerCopy copy;
    KovPager::instance()->reset();
    {
        KovBtree fresh(KovBtree::BlobTable);
        KovBtreeCursor d(fresh, true);
        insertBytes(d, "k", "v");
        *KovPager::instance() = *copy;
        EXPECT_TRUE(engineOpen());
        EXPECT_EQ(KovTestAccess::slots().size(), 1u);
        expectDistinctCursors();
        d.first();  // on the copy's slot now: whatever engine cursor it kept, if any
    }
    c.reset();
    table.reset();
    expectStoreWorks();
}

// A copy taken while the store was closed holds no engine; assigned back over an open engine it
// closes the store (the pager takes the copy's engine handle, which is none), and the engine that
// no pager holds any more is closed rather than lost.
TEST_F(CallOrder, CopyTakenWhileClosedAssignedBackOverAnOpenEngine) {
    KovPager::instance()->reset();
    PagerCopy closed;
    {
        KovBtree table(KovBtree::IntKeyTable);
        KovBtreeCursor c(table, true);
        c.insert(1, "one", 3);
    }
    ASSERT_TRUE(engineOpen());
    *KovPager::instance() = *closed;
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    expectStoreWorks();
}

TEST_F(CallOrder, SelfAssignmentChangesNothing) {
    KovBtree table(KovBtree::IntKeyTable);
    KovBtreeCursor c(table, true);
    c.insert(3, "three", 5);
    ASSERT_EQ(c.seek(std::int64_t{3}), 0);
    const std::string dir = KovTestAccess::tempDir(KovPager::instance());
    KovPager* pager = KovPager::instance();
    *pager = *pager;
    EXPECT_TRUE(engineOpen());
    EXPECT_EQ(KovTestAccess::tempDir(KovPager::instance()), dir);
    ASSERT_TRUE(c.good());
    EXPECT_EQ(intKey(c), 3);
    EXPECT_EQ(dataOf(c), "three");
}

// Tables and cursors made before reset() and used or destroyed after a new engine opened: the
// cursor was reopened on its old root page in the new database, which there names another table
// (or none), and the old table's destruction drops whatever table has that root page, as
// described. Nothing reads freed memory.
TEST_F(CallOrder, TablesAndCursorsFromBeforeResetUsedAfterANewEngine) {
    auto oldTable = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    auto oldCursor = std::make_unique<KovBtreeCursor>(*oldTable, true);
    oldCursor->insert(1, "old", 3);
    KovPager::instance()->reset();
    auto fresh = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    ASSERT_EQ(KovTestAccess::rootPage(*fresh), KovTestAccess::rootPage(*oldTable));
    // The old cursor now walks the fresh table, which has the same root page.
    oldCursor->insert(2, "two", 3);
    ASSERT_TRUE(oldCursor->first());
    EXPECT_EQ(intKey(*oldCursor), 2);
    oldCursor.reset();
    oldTable.reset();  // drops the fresh table: it has that root page
    {
        KovBtreeCursor onDropped(*fresh, true);  // refused: no table there any more
        EXPECT_FALSE(onDropped.first());
        onDropped.insert(3, "x", 1);
    }
    fresh.reset();  // its table is gone already: nothing happens
    expectStoreWorks();
}
