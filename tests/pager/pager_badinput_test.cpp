// Bad input through the store's public classes: null pointers, sizes past 32 bits, kinds out of
// range, objects destroyed in unusual orders, a refused cursor used for everything, the pager
// copied and assigned, many cursors and many tables. Each test states the outcome it pins down;
// docs/faults.md lists them under "Bad input". None of them may crash or leak.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "pager_test_util.h"
// After the engine binding's header, which shares SQLite's result-code names.
#include "engine/private_sqlite3.h"

using namespace kovtest;

namespace {

// The engine's database size in pages (its temporary file holds at most this many).
std::int64_t enginePages() {
    sqlite3* db = kov::engine::TEST_connection(KovTestAccess::engine());
    sqlite3_stmt* s = nullptr;
    std::int64_t pages = -1;
    if (sqlite3_prepare_v2(db, "PRAGMA page_count", -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW)
        pages = sqlite3_column_int64(s, 0);
    sqlite3_finalize(s);
    return pages;
}

// The process's peak resident set, in KiB (0 where /proc is missing).
long peakRssKiB() {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.compare(0, 6, "VmHWM:") == 0)
            return std::atol(line.c_str() + 6);
    }
    return 0;
}

// True under valgrind's memcheck, whose preloaded library shows in the process's mappings
// (false where /proc is missing).
bool underValgrind() {
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line)) {
        if (line.find("vgpreload") != std::string::npos)
            return true;
    }
    return false;
}

bool sanitized() {
#if defined(__SANITIZE_ADDRESS__)
    return true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
    return true;
#else
    return false;
#endif
#else
    return false;
#endif
}

}  // namespace

// The store reset, with no cursor left (StoreTest), for each test of this file.
class PagerBadInput : public kovtest::StoreTest {};

// Null pointers with size 0, on byte-string tables: a null key is not the empty key. seek and
// insert refuse it (seek answers negative and leaves the cursor where it was; insert adds
// nothing); a null data pointer with size 0 stores empty data; data(nullptr, 0) copies nothing.
TEST_F(PagerBadInput, NullPointersWithSizeZero) {
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor c(blobs, true);
    insertBytes(c, "k", "v");
    ASSERT_TRUE(c.first());
    EXPECT_LT(c.seek(nullptr, 0), 0);
    EXPECT_TRUE(c.good());
    EXPECT_EQ(byteKey(c), "k");

    c.insert(nullptr, 0, "d", 1);  // null key: refused
    c.insert("e", 1, nullptr, 0);  // empty data: stored
    auto all = walkBytes(c);
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].first, "e");
    EXPECT_EQ(all[0].second, "");
    EXPECT_EQ(all[1].first, "k");

    ASSERT_TRUE(c.first());
    c.data(nullptr, 0);  // nothing to copy
    EXPECT_TRUE(c.good());

    KovBtree keys(KovBtree::IndexTable);
    KovBtreeCursor k(keys, true);
    k.insert(nullptr, 0);  // null key: refused, not the empty key
    EXPECT_FALSE(k.first());
    k.insert("", 0);  // the empty key
    ASSERT_TRUE(k.first());
    EXPECT_EQ(byteKey(k), "");

    // indexKeySeek with a null key: the search is refused and the cursor steps to the next entry
    // from where it stood (here off the end: false). The empty prefix then matches anything.
    insertKey(k, "a");
    ASSERT_TRUE(k.last());
    EXPECT_FALSE(k.indexKeySeek(nullptr, 0));
    EXPECT_FALSE(k.good());
    ASSERT_TRUE(k.first());
    EXPECT_TRUE(k.indexKeySeek(nullptr, 0));  // from the empty key to "a"
    EXPECT_EQ(byteKey(k), "a");
    std::string payload = "old";
    EXPECT_TRUE(k.indexKeyFetch(nullptr, 0, payload));
    EXPECT_EQ(payload, "a");

    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor i(ints, true);
    i.insert(std::int64_t{5}, nullptr, 0);  // empty data: stored
    ASSERT_TRUE(i.first());
    EXPECT_EQ(intKey(i), 5);
    EXPECT_EQ(i.dataSize(), 0);
}

// Read sizes above 32 bits: only the low 32 bits reach the engine. A size of 2^32 + n copies n
// bytes; 2^32 copies nothing.
TEST_F(PagerBadInput, ReadSizesUseTheirLow32Bits) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    insertInt(c, 1, "abcdef");
    ASSERT_TRUE(c.first());
    char buf[8];
    std::memset(buf, '#', sizeof buf);
    c.data(buf, (std::uint64_t{1} << 32) + 4);
    EXPECT_EQ(std::string(buf, 8), "abcd####");
    std::memset(buf, '#', sizeof buf);
    c.data(buf, std::uint64_t{1} << 32);
    EXPECT_EQ(std::string(buf, 8), "########");
    c.data(buf, ~std::uint64_t{0});  // low bits 0xFFFFFFFF: past the entry, nothing
    EXPECT_EQ(std::string(buf, 8), "########");
}

// Data of 2^31 bytes or more (low 32 bits 0x80000000 and above, as a signed length negative) is
// refused before the buffer is read: no entry, no partial entry. Lengths from 10^9 to 2^31 - 1
// are above the engine's limit and refused the same way. A size of 2^32 or more is cut to its
// low 32 bits: 2^32 + 3 stores the first 3 bytes.
TEST_F(PagerBadInput, HugeDataSizesAreRefusedOrCutToTheirLow32Bits) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    const char small[4] = {'x', 'y', 'z', 'w'};
    c.insert(std::int64_t{1}, small, 0x80000000u);
    c.insert(std::int64_t{2}, small, 0xFFFFFFFFu);
    c.insert(std::int64_t{3}, small, 0x7FFFFFFFu);
    c.insert(std::int64_t{4}, small, std::uint64_t{1000000001});
    c.insert(std::int64_t{5}, small, (std::uint64_t{1} << 32) + 0x80000000u);
    EXPECT_TRUE(walkInts(c).empty());

    c.insert(std::int64_t{6}, small, (std::uint64_t{1} << 32) + 3);
    c.insert(std::int64_t{7}, small, std::uint64_t{1} << 32);
    auto all = walkInts(c);
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0], std::make_pair(std::int64_t{6}, std::string("xyz")));
    EXPECT_EQ(all[1], std::make_pair(std::int64_t{7}, std::string()));

    // The same on a byte-string table, and for keys: a key of 2^31 bytes or more (a 64-bit
    // length, not cut) is above the engine's limit and refused without being read.
    KovBtree blobs(KovBtree::BlobTable);
    KovBtreeCursor b(blobs, true);
    b.insert("k", 1, small, 0x80000000u);
    b.insert(small, 0x80000000u, "v", 1);
    b.insert(small, std::uint64_t{1} << 32, "v", 1);
    b.insert(small, ~std::uint64_t{0}, "v", 1);  // negative as a signed length
    EXPECT_TRUE(walkBytes(b).empty());
    EXPECT_LT(b.seek(small, 0x80000000u), 0);
    EXPECT_FALSE(b.good());
    EXPECT_FALSE(b.indexKeySeek(small, std::uint64_t{1} << 40));
}

// Kinds other than 0 and 1, whatever their value, make key-only tables: the data of a
// key-and-data insert is not kept, and dataSize() reads 0.
TEST_F(PagerBadInput, OutOfRangeKindsMakeKeyOnlyTables) {
    for (std::int32_t kind : {2, 3, -1, 255, INT32_MIN, INT32_MAX}) {
        SCOPED_TRACE(kind);
        KovBtree t(static_cast<KovBtree::TableType>(kind));
        EXPECT_EQ(slotOf(KovBtreeCursor(t, true)).tableFlags, 2u);
        KovBtreeCursor c(t, true);
        insertKey(c, "b");
        insertBytes(c, "a", "dropped");
        auto all = walkBytes(c);
        ASSERT_EQ(all.size(), 2u);
        EXPECT_EQ(all[0].first, "a");
        EXPECT_EQ(all[0].second, "");
        ASSERT_TRUE(c.first());
        EXPECT_EQ(c.dataSize(), 0);
    }
}

// The byte-string insert and seek forms on an integer table use the byte count as the integer
// key (the engine ignores the pointer there); the integer forms on a byte-string table are
// refused. The same holds for indexKeySeek; indexKeyFetch on an integer table is false.
TEST_F(PagerBadInput, ByteFormsOnAnIntegerTableUseTheLengthAsTheKey) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtreeCursor c(ints, true);
    c.insert("abc", 3, "data", 4);
    c.insert("zz", 2);
    auto all = walkInts(c);
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0], std::make_pair(std::int64_t{2}, std::string()));
    EXPECT_EQ(all[1], std::make_pair(std::int64_t{3}, std::string("data")));
    EXPECT_EQ(c.seek("xyz", 3), 0);
    EXPECT_EQ(intKey(c), 3);
    EXPECT_TRUE(c.indexKeySeek("q", 1));
    EXPECT_EQ(intKey(c), 2);
    std::string payload = "old";
    EXPECT_FALSE(c.indexKeyFetch("", 0, payload));
    EXPECT_EQ(payload, "old");
}

// A cursor destroyed after its table: the table was not dropped (a cursor was open) and the
// cursor's destruction frees its slot as usual; the store goes on working.
TEST_F(PagerBadInput, CursorDestroyedAfterItsTable) {
    auto table = std::make_unique<KovBtree>(KovBtree::BlobTable);
    auto cursor = std::make_unique<KovBtreeCursor>(*table, true);
    insertBytes(*cursor, "k", "v");
    table.reset();
    // The table is still there, and the cursor still reads it.
    ASSERT_TRUE(cursor->first());
    EXPECT_EQ(byteKey(*cursor), "k");
    cursor.reset();
    EXPECT_TRUE(KovTestAccess::slots().empty());
    KovBtree next(KovBtree::IntKeyTable);
    KovBtreeCursor c(next, true);
    insertInt(c, 1, "x");
    EXPECT_EQ(walkInts(c).size(), 1u);
}

// A cursor destroyed after reset leaves its slot live (the engine is closed); the next table
// creation reopens it in the fresh engine, where it reads the new table of that root page, if
// any. The slot is freed at the exit-time teardown.
TEST_F(PagerBadInput, CursorDestroyedAfterReset) {
    auto table = std::make_unique<KovBtree>(KovBtree::BlobTable);
    auto cursor = std::make_unique<KovBtreeCursor>(*table, true);
    insertBytes(*cursor, "k", "v");
    KovPager::instance()->reset();
    EXPECT_FALSE(cursor->first());  // inert
    cursor.reset();
    table.reset();
    ASSERT_EQ(KovTestAccess::slots().size(), 1u);
    EXPECT_NE(KovTestAccess::slots()[0].rootPage, kFreeSlot);
    {
        KovBtree fresh(KovBtree::BlobTable);
        EXPECT_EQ(KovTestAccess::slots().size(), 1u);
        KovBtreeCursor c(fresh, true);
        insertBytes(c, "a", "b");
        EXPECT_EQ(walkBytes(c).size(), 1u);
    }
    KovTestAccess::teardown();
    EXPECT_TRUE(KovTestAccess::slots().empty());
}

// Cursors and tables destroyed after the exit-time teardown find no engine and do nothing.
TEST_F(PagerBadInput, CursorAndTableDestroyedAfterTheTeardown) {
    auto table = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    auto writer = std::make_unique<KovBtreeCursor>(*table, true);
    auto reader = std::make_unique<KovBtreeCursor>(*table, false);
    insertInt(*writer, 1, "refused: a reader is open");
    KovTestAccess::teardown();
    EXPECT_FALSE(writer->first());
    EXPECT_FALSE(reader->good());
    EXPECT_EQ(intKey(*reader), 0);
    writer.reset();
    table.reset();  // before its last cursor: no engine, nothing happens
    reader.reset();
    EXPECT_TRUE(KovTestAccess::slots().empty());
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
}

// A writing cursor refused because a read cursor is open on its table answers "no entry" to
// everything, adds nothing, and is destroyed like any other.
TEST_F(PagerBadInput, RefusedWritingCursorDoesNothing) {
    KovBtree t(KovBtree::BlobTable);
    {
        KovBtreeCursor w(t, true);
        insertBytes(w, "ab", "v");
    }
    KovBtreeCursor reader(t, false);
    KovBtreeCursor refused(t, true);
    expectRefusedWriter(refused);
    EXPECT_LT(seekBytes(refused, "ab"), 0);
    EXPECT_LT(refused.seek(std::int64_t{1}), 0);
    insertBytes(refused, "zz", "refused");
    insertKey(refused, "zz");
    refused.insert(std::int64_t{1}, "x", 1);
    EXPECT_EQ(intKey(refused), 0);
    EXPECT_EQ(refused.dataSize(), 0);
    char buf[4] = {'#', '#', '#', '#'};
    refused.data(buf, 0);
    refused.data(buf, 4);
    EXPECT_EQ(std::string(buf, 4), "####");
    EXPECT_FALSE(refused.indexKeySeek("a", 1));
    std::string payload = "old";
    EXPECT_FALSE(refused.indexKeyFetch("a", 1, payload));
    EXPECT_EQ(payload, "old");
    EXPECT_TRUE(refused.indexKeyFetch("", 0, payload));  // no entry reads as the empty key
    EXPECT_EQ(payload, "");
    auto all = walkBytes(reader);
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0].first, "ab");
}

// A copy of the pager shares the engine; assigning it back to the process's pager while nothing
// changed in between (no table and no cursor made or destroyed) leaves the store as it was.
// Assigning a copy taken before a table creation or a cursor's destruction would bring back
// engine cursors that were since freed: hosts must not do it (the library never copies the
// pager).
TEST_F(PagerBadInput, PagerCopiedAndAssignedBackWhileNothingChanged) {
    KovBtree t(KovBtree::IntKeyTable);
    KovBtreeCursor c(t, true);
    insertInt(c, 1, "one");
    alignas(KovPager) unsigned char storage[sizeof(KovPager)];
    KovPager* copy = new (storage) KovPager(*KovPager::instance());
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);
    insertInt(c, 2, "two");  // inserts and moves change no registry entry
    *KovPager::instance() = *copy;
    *KovPager::instance() = *KovPager::instance();
    KovTestAccess::disposeCopy(copy);
    EXPECT_EQ(walkInts(c).size(), 2u);
    KovBtree other(KovBtree::BlobTable);
    EXPECT_EQ(walkInts(c).size(), 2u);
}

// 1 000 cursors, opened ten at a time around 100 table creations: every creation closes and
// reopens all of them, and each comes back on its entry. They are made as read cursors (a
// writing cursor made while a read cursor is open on the table would be refused); each table
// creation brings them back as writing cursors.
TEST_F(PagerBadInput, AThousandCursorsAcrossAHundredTableCreations) {
    std::vector<std::unique_ptr<KovBtree>> tables;
    std::vector<std::unique_ptr<KovBtreeCursor>> cursors;
    std::vector<std::int64_t> keys;
    tables.push_back(std::make_unique<KovBtree>(KovBtree::IntKeyTable));
    {
        KovBtreeCursor fill(*tables[0], true);
        for (std::int64_t k = 0; k < 1000; ++k)
            insertInt(fill, k * 3, "d" + std::to_string(k));
    }
    for (int round = 0; round < 100; ++round) {
        for (int i = 0; i < 10; ++i) {
            const std::int64_t k = static_cast<std::int64_t>(cursors.size()) * 3;
            cursors.push_back(std::make_unique<KovBtreeCursor>(*tables[0], false));
            ASSERT_EQ(cursors.back()->seek(k), 0);
            keys.push_back(k);
        }
        tables.push_back(std::make_unique<KovBtree>(static_cast<KovBtree::TableType>(round % 3)));
    }
    ASSERT_EQ(KovTestAccess::slots().size(), 1000u);
    for (std::size_t i = 0; i < cursors.size(); ++i) {
        ASSERT_TRUE(cursors[i]->good()) << i;
        EXPECT_EQ(intKey(*cursors[i]), keys[i]);
        EXPECT_EQ(dataOf(*cursors[i]), "d" + std::to_string(keys[i] / 3));
        EXPECT_NE(slotOf(*cursors[i]).cursor, nullptr);  // every one reopened as a writer
    }
    cursors.clear();
    EXPECT_TRUE(KovTestAccess::slots().empty());
    tables.clear();
}

// 100 000 tables made and destroyed one after the other, with no cursor open: each is dropped,
// so neither memory nor the database grows with their number.
TEST_F(PagerBadInput, AHundredThousandTablesMadeAndDestroyed) {
    const int count = sanitized() ? 20000 : 100000;
    // Warm up: the first tables settle the engine's bookkeeping and the free pages.
    for (int i = 0; i < 1000; ++i)
        KovBtree t(static_cast<KovBtree::TableType>(i % 3));
    const long rssBefore = peakRssKiB();
    const std::int64_t pagesBefore = enginePages();
    for (int i = 0; i < count; ++i)
        KovBtree t(static_cast<KovBtree::TableType>(i % 3));
    const long rssAfter = peakRssKiB();
    const std::int64_t pagesAfter = enginePages();
    std::printf("peak RSS %ld -> %ld KiB, database %lld -> %lld pages after %d tables\n", rssBefore,
                rssAfter, static_cast<long long>(pagesBefore), static_cast<long long>(pagesAfter),
                count);
    // AddressSanitizer holds freed memory in quarantine (up to 256 MiB), and so does valgrind
    // (20 MB): there the resident set says nothing about growth, and their leak checks do the job.
    if (!sanitized() && !underValgrind()) {
        EXPECT_LT(rssAfter - rssBefore, 16 * 1024);
    }
    EXPECT_LE(pagesAfter, pagesBefore + 8);
    KovBtree last(KovBtree::BlobTable);
    KovBtreeCursor c(last, true);
    insertBytes(c, "k", "v");
    EXPECT_EQ(walkBytes(c).size(), 1u);
}
