// The pager and its cursor registry, tables, the composite index keys, and the typical use of
// the store from start to end.
#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
#include <cstring>
#include <new>
#include <string>
#include <thread>
#include <vector>

#include "engine/btree.h"  // before <sqlite3.h>: they share the result-code names

#include "engine/private_sqlite3.h"

#include "pager_test_util.h"
#include "tempdir/TempDirectory.h"

using namespace kovtest;

namespace {

std::int64_t pragmaValue(const char* pragma) {
    return kov::engine::TEST_pragmaValue(KovTestAccess::engine(), pragma);
}

std::string bytes8(std::int64_t v) {
    std::string s(8, '\0');
    std::memcpy(s.data(), &v, 8);
    return s;
}

}  // namespace

// ---------------------------------------------------------------------------------------------
// Pager and registry

TEST(Pager, InstanceFromTwoThreadsIsOnePagerWithOneEngine) {
    // Run first in its process (as ctest runs it), the two calls construct the pager, which opens
    // its engine: exactly one engine between them. Run after other tests in the same process,
    // the pager exists already and neither call opens one.
    const std::uint64_t openedBefore = kov::engine::TEST_enginesOpened();
    std::atomic<bool> go{false};
    KovPager* seen[2] = {nullptr, nullptr};
    std::thread a([&] {
        while (!go) {
        }
        seen[0] = KovPager::instance();
    });
    std::thread b([&] {
        while (!go) {
        }
        seen[1] = KovPager::instance();
    });
    go = true;
    a.join();
    b.join();
    ASSERT_NE(seen[0], nullptr);
    EXPECT_EQ(seen[0], seen[1]);
    EXPECT_EQ(seen[0], KovPager::instance());
    EXPECT_EQ(kov::engine::TEST_enginesOpened() - openedBefore, openedBefore == 0 ? 1u : 0u);
    // After an earlier test's reset, the next table opens the engine.
    KovBtree table(KovBtree::IntKeyTable);
    EXPECT_NE(KovTestAccess::engine(), nullptr);
}

TEST(Pager, EngineOpensWithFixedPageAndCacheSizes) {
    // The store's fixed sizes: 4096-byte pages, 16384 of them (64 MiB) in the cache.
    EXPECT_EQ(KovTestAccess::defaultPageSize(), 4096);
    EXPECT_EQ(KovTestAccess::defaultCacheSize(), 16384);
    KovBtree table(KovBtree::IntKeyTable);
    EXPECT_EQ(pragmaValue("PRAGMA page_size"), KovTestAccess::defaultPageSize());
    EXPECT_EQ(pragmaValue("PRAGMA cache_size"), KovTestAccess::defaultCacheSize());
}

TEST(Pager, EngineDirectorySettingIsThePagersOwnCopy) {
    KovPager* pager = KovPager::instance();
    const std::string& dir = KovTestAccess::tempDir(pager);
    EXPECT_EQ(dir, kov::getTempDirectory());
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), dir.c_str());
}

// The store reset, with no cursor left (StoreTest), for each test of this file.
class PagerStore : public kovtest::StoreTest {};

TEST_F(PagerStore, CloseAllOnEmptyRegistryEmptiesSavedAndRestoreDoesNothing) {
    std::vector<std::string> saved{"left", "over"};
    KovTestAccess::closeAllCursors(saved);
    EXPECT_TRUE(saved.empty());
    KovTestAccess::restoreAllCursors(saved);
    EXPECT_TRUE(KovTestAccess::slots().empty());
}

TEST_F(PagerStore, UnpositionedAndPastEndCursorsAreSavedAsZeroOrEmptyKey) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor wi(ints, true);
    KovBtreeCursor wb(blobs, true);
    insertInt(wi, 5, "five");
    insertInt(wi, 9, "nine");
    insertBytes(wb, "m", "em");
    KovBtreeCursor neverInt(ints, false);
    KovBtreeCursor pastEndBytes(blobs, false);
    ASSERT_TRUE(pastEndBytes.last());
    ASSERT_FALSE(pastEndBytes.next());

    std::vector<std::string> saved;
    KovTestAccess::closeAllCursors(saved);
    ASSERT_EQ(saved.size(), 4u);
    EXPECT_EQ(saved[2], bytes8(0));
    EXPECT_EQ(saved[3], "");
    for (const kov::pager::CursorSlot& s : KovTestAccess::slots())
        EXPECT_EQ(s.cursor, nullptr);
    KovTestAccess::restoreAllCursors(saved);
    for (const kov::pager::CursorSlot& s : KovTestAccess::slots())
        EXPECT_NE(s.cursor, nullptr);

    // Searched for 0 and for the empty key: on a non-empty table they come back on an entry.
    EXPECT_TRUE(neverInt.good());
    EXPECT_EQ(intKey(neverInt), 5);
    EXPECT_TRUE(pastEndBytes.good());
    EXPECT_EQ(byteKey(pastEndBytes), "m");
}

TEST_F(PagerStore, PastEndCursorReportsAnEntryAfterATableIsCreated) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    insertInt(c, 3, "x");
    ASSERT_TRUE(c.last());
    ASSERT_FALSE(c.next());
    ASSERT_FALSE(c.good());
    KovBtree other(KovBtree::BlobTable);
    EXPECT_TRUE(c.good());
    EXPECT_EQ(intKey(c), 3);
}

TEST_F(PagerStore, IntegerCursorOnMinusOneIsSavedAsAllOnesAndComesBack) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    insertInt(c, -1, "minus one");
    insertInt(c, -2, "minus two");
    insertInt(c, 7, "seven");
    ASSERT_EQ(c.seek(std::int64_t{-1}), 0);

    std::vector<std::string> saved;
    KovTestAccess::closeAllCursors(saved);
    ASSERT_EQ(saved.size(), 1u);
    EXPECT_EQ(saved[0], std::string(8, '\xFF'));
    KovTestAccess::restoreAllCursors(saved);
    EXPECT_TRUE(c.good());
    EXPECT_EQ(intKey(c), -1);
    EXPECT_EQ(dataOf(c), "minus one");
}

TEST_F(PagerStore, ByteCursorComesBackOnItsKeyShortOrLong) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor w(blobs, true);
    const std::string shortKey = "fifteen bytes!!";  // 15 bytes
    const std::string longKey(40, 'q');
    const std::string longNeighbour = std::string(39, 'q') + "p";
    insertBytes(w, shortKey, "s");
    insertBytes(w, shortKey + "z", "s2");
    insertBytes(w, longKey, "l");
    insertBytes(w, longNeighbour, "n");
    insertBytes(w, longKey + "r", "l2");
    KovBtreeCursor a(blobs, false);
    KovBtreeCursor b(blobs, false);
    ASSERT_EQ(seekBytes(a, shortKey), 0);
    ASSERT_EQ(seekBytes(b, longKey), 0);

    KovBtree created(KovBtree::IntKeyTable);
    ASSERT_TRUE(a.good());
    EXPECT_EQ(byteKey(a), shortKey);
    ASSERT_TRUE(b.good());
    EXPECT_EQ(byteKey(b), longKey);
    EXPECT_EQ(dataOf(b), "l");
}

TEST_F(PagerStore, ReadCursorComesBackAsWritingCursorAfterTableCreation) {
    KovBtree t(KovBtree::IntKeyTable);
    KovBtreeCursor reader(t, false);
    {
        KovBtreeCursor refused(t, true);
        EXPECT_EQ(slotOf(refused).cursor, nullptr);
        insertInt(refused, 1, "no");
        EXPECT_FALSE(refused.first());
    }
    insertInt(reader, 1, "no");
    EXPECT_FALSE(reader.first());

    KovBtree other(KovBtree::BlobTable);
    KovBtreeCursor writer(t, true);
    EXPECT_NE(slotOf(writer).cursor, nullptr);
    insertInt(reader, 2, "through the old reader");
    ASSERT_TRUE(writer.first());
    EXPECT_EQ(intKey(writer), 2);
    EXPECT_EQ(dataOf(writer), "through the old reader");
}

TEST_F(PagerStore, FreeSlotsKeepTheirPlacesUntilTheyTrail) {
    KovBtree t(KovBtree::BlobTable);
    auto a = std::make_unique<KovBtreeCursor>(t, true);
    auto b = std::make_unique<KovBtreeCursor>(t, true);
    auto c = std::make_unique<KovBtreeCursor>(t, true);
    EXPECT_EQ(KovTestAccess::slotIndex(*a), 0u);
    EXPECT_EQ(KovTestAccess::slotIndex(*b), 1u);
    EXPECT_EQ(KovTestAccess::slotIndex(*c), 2u);
    b.reset();
    ASSERT_EQ(KovTestAccess::slots().size(), 3u);
    EXPECT_EQ(KovTestAccess::slots()[1].rootPage, kFreeSlot);
    EXPECT_EQ(KovTestAccess::slots()[1].cursor, nullptr);
    EXPECT_EQ(KovTestAccess::slots()[1].tableFlags, 0u);
    EXPECT_EQ(KovTestAccess::slots()[2].rootPage, KovTestAccess::rootPage(t));

    // A new cursor goes at the end, never into the free slot.
    auto d = std::make_unique<KovBtreeCursor>(t, true);
    EXPECT_EQ(KovTestAccess::slotIndex(*d), 3u);
    d.reset();
    ASSERT_EQ(KovTestAccess::slots().size(), 3u);

    c.reset();
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    a.reset();
    EXPECT_TRUE(KovTestAccess::slots().empty());
}

TEST_F(PagerStore, SlotCopiesRootPageAndFlagsOfItsTable) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtree blobs(KovBtree::BlobTable);
    KovBtree index(KovBtree::IndexTable);
    KovBtreeCursor ci(ints, false);
    KovBtreeCursor cb(blobs, false);
    KovBtreeCursor cx(index, false);
    EXPECT_EQ(slotOf(ci).rootPage, KovTestAccess::rootPage(ints));
    EXPECT_EQ(slotOf(ci).tableFlags, 5u);
    EXPECT_EQ(slotOf(cb).rootPage, KovTestAccess::rootPage(blobs));
    EXPECT_EQ(slotOf(cb).tableFlags, 0u);
    EXPECT_EQ(slotOf(cx).rootPage, KovTestAccess::rootPage(index));
    EXPECT_EQ(slotOf(cx).tableFlags, 2u);
    EXPECT_NE(KovTestAccess::rootPage(ints), KovTestAccess::rootPage(blobs));
}

TEST_F(PagerStore, ResetTwiceInARowDoesNothingMore) {
    KovBtree t(KovBtree::BlobTable);
    KovPager::instance()->reset();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    const std::string dir = KovTestAccess::tempDir(KovPager::instance());
    KovPager::instance()->reset();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    EXPECT_EQ(KovTestAccess::tempDir(KovPager::instance()), dir);
    EXPECT_TRUE(KovTestAccess::slots().empty());
}

TEST_F(PagerStore, CopyAndAssignmentKeepTheEngineDirectorySettingValid) {
    KovPager* pager = KovPager::instance();
    const std::string original = KovTestAccess::tempDir(pager);
    KovBtree t(KovBtree::IntKeyTable);
    KovBtreeCursor c(t, true);
    kov::engine::Btree* const engine = KovTestAccess::engine();

    alignas(KovPager) unsigned char storage[sizeof(KovPager)];
    KovPager* copy = new (storage) KovPager(*pager);
    EXPECT_EQ(KovTestAccess::tempDir(copy), original);
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), KovTestAccess::tempDir(pager).c_str());

    // Self-assignment changes nothing.
    *pager = *pager;
    EXPECT_EQ(KovTestAccess::tempDir(pager), original);
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_EQ(KovTestAccess::engine(), engine);

    // A longer text moves the buffer; the setting follows it.
    KovTestAccess::tempDir(copy) = original + std::string(200, 'x');
    *pager = *copy;
    EXPECT_EQ(KovTestAccess::tempDir(pager), original + std::string(200, 'x'));
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), KovTestAccess::tempDir(pager).c_str());
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);

    // Assigning to the copy leaves the setting alone.
    KovTestAccess::tempDir(copy) = original;
    *copy = *copy;
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), KovTestAccess::tempDir(pager).c_str());
    *pager = *copy;
    EXPECT_EQ(KovTestAccess::tempDir(pager), original);
    EXPECT_EQ(kov::engine::temporaryDirectorySetting(), KovTestAccess::tempDir(pager).c_str());
    KovTestAccess::disposeCopy(copy);

    insertInt(c, 4, "still open");
    ASSERT_TRUE(c.first());
    EXPECT_EQ(dataOf(c), "still open");
}

// ---------------------------------------------------------------------------------------------
// Tables

TEST_F(PagerStore, CreatingATableKeepsOpenCursorsOnTheirEntries) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtree blobs(KovBtree::BlobTable);
    KovBtree index(KovBtree::IndexTable);
    {
        KovBtreeCursor wi(ints, true);
        for (int i = 0; i < 50; ++i)
            insertInt(wi, i * 10, "v" + std::to_string(i));
    }
    {
        KovBtreeCursor wb(blobs, true);
        for (int i = 0; i < 50; ++i)
            insertBytes(wb, "key" + std::to_string(i), "d");
    }
    {
        KovBtreeCursor wx(index, true);
        for (int i = 0; i < 50; ++i)
            insertKey(wx, "ix" + std::to_string(i));
    }
    KovBtreeCursor ci(ints, false);
    KovBtreeCursor cb(blobs, false);
    KovBtreeCursor cx(index, true);
    ASSERT_EQ(ci.seek(std::int64_t{230}), 0);
    ASSERT_EQ(seekBytes(cb, "key17"), 0);
    ASSERT_EQ(seekBytes(cx, "ix42"), 0);

    KovBtree made(KovBtree::BlobTable);
    EXPECT_EQ(intKey(ci), 230);
    EXPECT_EQ(dataOf(ci), "v23");
    EXPECT_EQ(byteKey(cb), "key17");
    EXPECT_EQ(byteKey(cx), "ix42");
    ASSERT_TRUE(ci.next());
    EXPECT_EQ(intKey(ci), 240);
    ASSERT_TRUE(cx.previous());
    EXPECT_EQ(byteKey(cx), "ix41");
}

TEST_F(PagerStore, CreatingATableAfterResetOpensAFreshEngine) {
    std::uint32_t firstRoot = 0;
    {
        KovPager::instance()->reset();
        KovBtree first(KovBtree::IntKeyTable);
        firstRoot = KovTestAccess::rootPage(first);
        KovBtreeCursor c(first, true);
        insertInt(c, 1, "gone soon");
    }
    KovPager::instance()->reset();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    KovBtree again(KovBtree::IntKeyTable);
    EXPECT_NE(KovTestAccess::engine(), nullptr);
    EXPECT_NE(KovTestAccess::rootPage(again), 0u);
    EXPECT_EQ(KovTestAccess::rootPage(again), firstRoot);  // the first table of an empty database
    KovBtreeCursor c(again, false);
    EXPECT_FALSE(c.first());
}

TEST_F(PagerStore, KindsOtherThanZeroAndOneMakeKeyOnlyTables) {
    for (std::int32_t kind : {2, 3, -1, 1000}) {
        KovBtree t(static_cast<KovBtree::TableType>(kind));
        KovBtreeCursor c(t, true);
        EXPECT_EQ(slotOf(c).tableFlags, 2u) << kind;
        insertKey(c, "only a key");
        ASSERT_TRUE(c.first()) << kind;
        EXPECT_EQ(byteKey(c), "only a key");
        EXPECT_EQ(c.dataSize(), 0);
    }
}

TEST_F(PagerStore, DestroyingATableWhileACursorIsOpenElsewhereKeepsIt) {
    KovBtree holder(KovBtree::BlobTable);
    std::uint32_t keptRoot = 0;
    std::uint32_t nextRoot = 0;
    {
        KovBtreeCursor open(holder, false);
        {
            KovBtree doomed(KovBtree::IntKeyTable);
            keptRoot = KovTestAccess::rootPage(doomed);
        }  // the drop is refused: a cursor is open
        KovBtree after(KovBtree::IntKeyTable);
        nextRoot = KovTestAccess::rootPage(after);
        EXPECT_NE(nextRoot, keptRoot);  // the kept table's pages are not reused
    }
    // The kept table is still there: a cursor can be opened on its root page.
    sqlite3* db = kov::engine::TEST_connection(KovTestAccess::engine());
    ASSERT_NE(db, nullptr);
    kov::engine::BtCursor* raw = nullptr;
    EXPECT_EQ(kov::engine::sqlite3BtreeCursor(KovTestAccess::engine(), keptRoot, 0, nullptr,
                                              nullptr, &raw),
              SQLITE_OK);
    ASSERT_NE(raw, nullptr);
    kov::engine::sqlite3BtreeCloseCursor(raw);
}

TEST_F(PagerStore, DestroyingATableWithNoCursorOpenDropsIt) {
    std::uint32_t root = 0;
    {
        KovBtree t(KovBtree::IntKeyTable);
        root = KovTestAccess::rootPage(t);
        KovBtreeCursor c(t, true);
        insertInt(c, 1, "x");
    }
    kov::engine::BtCursor* raw = nullptr;
    kov::engine::sqlite3BtreeCursor(KovTestAccess::engine(), root, 0, nullptr, nullptr, &raw);
    EXPECT_EQ(raw, nullptr);  // no table has that root any more
    KovBtree reuse(KovBtree::IntKeyTable);
    EXPECT_EQ(KovTestAccess::rootPage(reuse), root);  // its page is free for the next table
    KovBtreeCursor c(reuse, false);
    EXPECT_FALSE(c.first());
}

TEST_F(PagerStore, DestroyingATableAfterResetDoesNothing) {
    {
        KovBtree t(KovBtree::IntKeyTable);
        KovPager::instance()->reset();
    }
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    EXPECT_TRUE(KovTestAccess::slots().empty());
}

// ---------------------------------------------------------------------------------------------
// Cursor operations specific to one kind

TEST_F(PagerStore, IntegerKeyIsTheInsertedKeyAndByteKeyReportsItsLength) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor ci(ints, true);
    KovBtreeCursor cb(blobs, true);
    insertInt(ci, -9000000000LL, "big");
    insertBytes(cb, "seven b", "data");
    ASSERT_TRUE(ci.first());
    ASSERT_TRUE(cb.first());
    EXPECT_EQ(intKey(ci), -9000000000LL);
    EXPECT_EQ(intKey(cb), 7);
}

TEST_F(PagerStore, BufferReadsCopyExactlyWhatFitsAndNothingPastTheEntry) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor cb(blobs, true);
    KovBtreeCursor ci(ints, true);
    insertBytes(cb, "key", "DATA");
    insertInt(ci, 5, "data");
    ASSERT_TRUE(cb.first());
    ASSERT_TRUE(ci.first());

    std::string buf(7, '.');
    KovTestAccess::key(cb, buf.data(), 7);  // key read continues into the data
    EXPECT_EQ(buf, "keyDATA");
    buf.assign(8, '.');
    KovTestAccess::key(cb, buf.data(), 8);  // past key plus data: nothing
    EXPECT_EQ(buf, "........");
    buf.assign(2, '.');
    cb.data(buf.data(), 2);
    EXPECT_EQ(buf, "DA");
    buf.assign(5, '.');
    cb.data(buf.data(), 5);
    EXPECT_EQ(buf, ".....");
    buf.assign(4, '.');
    KovTestAccess::dataBuf(cb, buf.data(), 4);
    EXPECT_EQ(buf, "DATA");

    buf.assign(8, '.');
    KovTestAccess::key(ci, buf.data(), 1);  // integer keys are not bytes
    EXPECT_EQ(buf, "........");
    EXPECT_EQ(KovTestAccess::keySize(ci), 5);
}

TEST_F(PagerStore, EmptyKeyIsAnOrdinaryKey) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor c(blobs, true);
    insertBytes(c, "", "empty");
    insertBytes(c, "a", "a");
    EXPECT_EQ(seekBytes(c, ""), 0);
    EXPECT_EQ(KovTestAccess::keySize(c), 0);
    EXPECT_EQ(dataOf(c), "empty");
    ASSERT_TRUE(c.next());
    EXPECT_EQ(byteKey(c), "a");
}

TEST_F(PagerStore, ByteKeysOrderUnsignedAndShorterFirst) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor c(blobs, true);
    for (const char* k : {"b", "\xff", "ab", "a", "a\x01", "\x7f"})
        insertBytes(c, k, "");
    std::vector<std::string> keys;
    for (auto& kv : walkBytes(c))
        keys.push_back(kv.first);
    EXPECT_EQ(keys, (std::vector<std::string>{"a", "a\x01", "ab", "b", "\x7f", "\xff"}));
}

TEST_F(PagerStore, IntegerKeysOrderSigned) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    for (std::int64_t k : {INT64_C(3), INT64_C(-1), INT64_MAX, INT64_MIN, INT64_C(0)}) {
        insertInt(c, k, "");
    }
    std::vector<std::int64_t> keys;
    for (auto& kv : walkInts(c))
        keys.push_back(kv.first);
    EXPECT_EQ(keys, (std::vector<std::int64_t>{INT64_MIN, -1, 0, 3, INT64_MAX}));
}

TEST_F(PagerStore, WrongKeyFormIsRefusedAndLeavesTheCursorInPlace) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor c(blobs, true);
    insertBytes(c, "k", "v");
    ASSERT_TRUE(c.first());
    EXPECT_LT(c.seek(std::int64_t{1}), 0);
    EXPECT_TRUE(c.good());
    EXPECT_EQ(byteKey(c), "k");
    c.insert(std::int64_t{1}, "x", 1);
    EXPECT_EQ(walkBytes(c).size(), 1u);
}

// ---------------------------------------------------------------------------------------------
// Composite index keys

class IndexKeys : public StoreTest {
  protected:
    void fill(KovBtreeCursor& c) {
        for (const char* k : {"ab1", "ab22", "ac"})
            insertKey(c, k);
    }
};

TEST_F(IndexKeys, WalkOneGroupByPrefix) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    std::string payload;
    ASSERT_TRUE(c.indexKeySeek("ab", 2));
    EXPECT_EQ(byteKey(c), "ab1");
    ASSERT_TRUE(c.indexKeyFetch("ab", 2, payload));
    EXPECT_EQ(payload, "1");
    ASSERT_TRUE(c.next());
    ASSERT_TRUE(c.indexKeyFetch("ab", 2, payload));
    EXPECT_EQ(payload, "22");
    ASSERT_TRUE(c.next());
    EXPECT_FALSE(c.indexKeyFetch("ab", 2, payload));
}

TEST_F(IndexKeys, SeekPastEveryKeyOrOnEmptyTableIsFalse) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    EXPECT_FALSE(c.indexKeySeek("ab", 2));
    EXPECT_FALSE(c.good());
    fill(c);
    EXPECT_FALSE(c.indexKeySeek("b", 1));
    EXPECT_FALSE(c.good());
}

TEST_F(IndexKeys, SeekOfAnExistingKeyStandsOnIt) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    ASSERT_TRUE(c.indexKeySeek("ab22", 4));
    EXPECT_EQ(byteKey(c), "ab22");
    ASSERT_TRUE(c.indexKeySeek("ab3", 3));
    EXPECT_EQ(byteKey(c), "ac");
}

TEST_F(IndexKeys, PrivateFetchNeedsTheExactLength) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    ASSERT_TRUE(c.indexKeySeek("ab22", 4));
    char buf[4] = {'.', '.', '.', '.'};
    EXPECT_FALSE(KovTestAccess::indexKeyFetch(c, "ab", 2, buf, 1));
    EXPECT_FALSE(KovTestAccess::indexKeyFetch(c, "ab", 2, buf, 3));
    EXPECT_EQ(std::string(buf, 4), "....");
    EXPECT_FALSE(KovTestAccess::indexKeyFetch(c, "ax", 2, buf, 2));
    EXPECT_EQ(std::string(buf, 4), "....");
    EXPECT_TRUE(KovTestAccess::indexKeyFetch(c, "ab", 2, buf, 2));
    EXPECT_EQ(std::string(buf, 4), "22..");
}

TEST_F(IndexKeys, EmptyPrefixMatchesEveryEntry) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    std::vector<std::string> seen;
    std::string payload;
    for (bool on = c.indexKeySeek("", 0); on && c.indexKeyFetch("", 0, payload); on = c.next()) {
        seen.push_back(payload);
    }
    EXPECT_EQ(seen, (std::vector<std::string>{"ab1", "ab22", "ac"}));
}

TEST_F(IndexKeys, PublicFetchOnAShorterKeyIsFalseAndLeavesThePayload) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    std::string payload = "untouched";
    EXPECT_FALSE(c.indexKeyFetch("ab", 2, payload));  // on no entry
    EXPECT_EQ(payload, "untouched");
    ASSERT_TRUE(c.indexKeySeek("ac", 2));
    EXPECT_FALSE(c.indexKeyFetch("acdc", 4, payload));  // key shorter than the prefix
    EXPECT_EQ(payload, "untouched");
}

TEST_F(IndexKeys, PublicFetchOnAnotherPrefixResizesAndPads) {
    KovBtree t(KovBtree::IndexTable);
    KovBtreeCursor c(t, true);
    fill(c);
    ASSERT_TRUE(c.indexKeySeek("ab22", 4));
    std::string payload = "x";
    EXPECT_FALSE(c.indexKeyFetch("zz", 2, payload));
    EXPECT_EQ(payload, std::string("x\0", 2));
}

// ---------------------------------------------------------------------------------------------
// The typical use, start to end.

TEST_F(PagerStore, TypicalUseInsertCreateAnotherTableThenWalk) {
    KovBtree numbers(KovBtree::IntKeyTable);
    KovBtreeCursor writer(numbers, true);
    for (std::int64_t k = 1; k <= 1000; ++k)
        insertInt(writer, k * 3, "n" + std::to_string(k));
    ASSERT_EQ(writer.seek(std::int64_t{300}), 0);

    KovBtree second(KovBtree::BlobTable);  // the writer is closed and reopened on key 300
    ASSERT_TRUE(writer.good());
    EXPECT_EQ(intKey(writer), 300);

    std::int64_t expected = 3;
    std::size_t count = 0;
    for (bool on = writer.first(); on; on = writer.next()) {
        std::int64_t k = 0;
        writer.key(k);
        ASSERT_EQ(k, expected);
        ASSERT_EQ(dataOf(writer), "n" + std::to_string(k / 3));
        expected += 3;
        ++count;
    }
    EXPECT_EQ(count, 1000u);
    EXPECT_FALSE(writer.good());
}
