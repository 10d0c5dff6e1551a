// KovPager::failed() and failure(): a failure that loses or refuses data shows there, from the
// operation that met it until reset(); the refusals the store makes by design do not. The I/O
// faults (a failed read or write, a full disk, a temporary file refused) are injected in
// tests/pager/pager_fault_test.cpp; here: the store's own refusals, the engine that cannot be opened,
// memory running out inside the engine, and a temporary directory that cannot take a file.
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <string>

#include "engine/btree.h"
#include "pager_test_util.h"
#include "scratch_directory.h"
// After the engine binding's header, which shares SQLite's result-code names.
#include "engine/private_sqlite3.h"

using namespace kovtest;

namespace {

// A cap on the memory of the library's SQLite, lifted on destruction.
class HeapCap {
  public:
    explicit HeapCap(sqlite3_int64 bytes) { sqlite3_hard_heap_limit64(bytes); }
    ~HeapCap() { sqlite3_hard_heap_limit64(0); }
    HeapCap(const HeapCap&) = delete;
    HeapCap& operator=(const HeapCap&) = delete;
};

// Inserts records of `size` bytes under keys from `first` until `count` are in.
void fill(KovBtreeCursor& c, std::int64_t first, std::int64_t count, std::size_t size) {
    const std::string data(size, 'd');
    for (std::int64_t k = first; k < first + count; ++k)
        c.insert(k, data.data(), data.size());
}

std::int64_t countEntries(KovBtreeCursor& c) {
    std::int64_t n = 0;
    for (bool on = c.first(); on; on = c.next())
        ++n;
    return n;
}

// The store after reset() and a new table: no failure, and it works.
void expectFreshStoreWorks() {
    KovPager::instance()->reset();
    EXPECT_FALSE(KovPager::instance()->failed());
    EXPECT_EQ(KovPager::instance()->failure(), "");
    KovBtree table(KovBtree::IntKeyTable);
    KovBtreeCursor c(table, true);
    fill(c, 0, 100, 10);
    EXPECT_EQ(countEntries(c), 100);
    EXPECT_FALSE(KovPager::instance()->failed());
}

}  // namespace

// The store reset, with no cursor left (StoreTest), for each test of this file.
class PagerFailure : public kovtest::StoreTest {};

TEST_F(PagerFailure, NoFailureOnAFreshStore) {
    EXPECT_FALSE(KovPager::instance()->failed());
    EXPECT_EQ(KovPager::instance()->failure(), "");
}

// Everything the store refuses by design leaves failed() false.
TEST_F(PagerFailure, RefusalsByDesignAreNotFailures) {
    KovBtree ints(KovBtree::IntKeyTable);
    KovBtree bytes(KovBtree::BlobTable);
    {
        KovBtreeCursor reader(ints, false);
        reader.insert(1, "x", 1);                    // through a read cursor
        KovBtreeCursor refused(ints, true);          // a writer while a reader is open
        refused.insert(2, "y", 1);
        refused.first();
        KovBtreeCursor writer(bytes, true);
        writer.insert(std::int64_t{5}, "z", 1);      // the integer form on a byte table
        writer.insert(nullptr, 0, "z", 1);           // a null key
        writer.insert("k", 1, "d", std::uint64_t{1} << 31);  // a data size refused
        std::string payload;
        writer.first();
        writer.indexKeyFetch("long prefix", 11, payload);
        EXPECT_LT(writer.seek(nullptr, 0), 0);
        char buffer[100];
        writer.data(buffer, 100);                    // more than the entry holds
        KovBtree made(KovBtree::IndexTable);         // a table made while cursors are open
    }
    KovBtree dropped(KovBtree::IndexTable);
    {
        KovBtreeCursor open(ints, false);
        // `dropped` goes while a cursor is open: its drop is refused.
    }
    EXPECT_FALSE(KovPager::instance()->failed()) << KovPager::instance()->failure();
    EXPECT_EQ(KovPager::instance()->failure(), "");
}

// The engine cannot be opened (its SQLite has no memory for the connection): failed() turns
// true at the table construction that opened it, and failure() says so; the table is unusable
// (root page 0). Later tables try again; reset() clears the failure.
TEST_F(PagerFailure, EngineThatCannotBeOpened) {
    KovPager::instance()->reset();
    std::unique_ptr<KovBtree> unusable;
    std::unique_ptr<KovBtreeCursor> c;
    {
        HeapCap cap(1);  // below what SQLite already holds: every allocation is refused
        unusable = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
        EXPECT_EQ(KovTestAccess::rootPage(*unusable), 0u);
        EXPECT_EQ(KovTestAccess::engine(), nullptr);
        EXPECT_TRUE(KovPager::instance()->failed());
        const std::string text = KovPager::instance()->failure();
        EXPECT_TRUE(contains(text, "opening its engine")) << text;
        EXPECT_TRUE(contains(text, "out of memory")) << text;
        EXPECT_TRUE(contains(text, KovTestAccess::tempDir(KovPager::instance()))) << text;
        c = std::make_unique<KovBtreeCursor>(*unusable, true);
        c->insert(1, "x", 1);
        EXPECT_FALSE(c->first());
    }
    // Memory is back: the next table opens the engine, and the first failure is still told.
    {
        KovBtree table(KovBtree::IntKeyTable);
        EXPECT_NE(KovTestAccess::rootPage(table), 0u);
        EXPECT_TRUE(KovPager::instance()->failed());
        EXPECT_TRUE(contains(KovPager::instance()->failure(), "opening its engine"));
    }
    c.reset();
    unusable.reset();
    expectFreshStoreWorks();
}

// Memory runs out inside the engine while a table grows: the insert that met it is lost (and,
// half-done, may leave the table being written damaged, as any failed insert can),
// failed() turns true and failure() names the insert and the engine's message; every later
// insert is refused, another table reads back whole, and reset() gives a working store again.
TEST_F(PagerFailure, OutOfMemoryInsideTheEngine) {
    // Inserts straight into the B-tree: each one meets the memory cap itself.
    kov::engine::test::ScopedLoadLimits straight{kov::engine::test::kStraightLoads};
    KovPager::instance()->reset();
    KovBtree kept(KovBtree::IntKeyTable);
    KovBtree grown(KovBtree::IntKeyTable);
    KovBtreeCursor keeper(kept, true);
    KovBtreeCursor grower(grown, true);
    fill(keeper, 0, 1000, 100);
    // The temporary file is opened before memory is capped, by a spill through a small cache:
    // on some platforms opening it takes memory (a buffer for its name), and a failed open is an
    // I/O error, which costs every table, where this test is about memory running out.
    kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), 16);
    fill(grower, -1000, 100, 1000);
    kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(),
                                          KovTestAccess::defaultCacheSize());
    ASSERT_FALSE(KovPager::instance()->failed());
    {
        HeapCap cap(sqlite3_memory_used() + 64 * 1024);
        std::int64_t k = 0;
        while (!KovPager::instance()->failed() && k < 100000) {
            fill(grower, k, 100, 1000);
            k += 100;
        }
        ASSERT_TRUE(KovPager::instance()->failed()) << "the cap was never reached";
        const std::string text = KovPager::instance()->failure();
        EXPECT_TRUE(contains(text, "while inserting an entry: out of memory")) << text;
    }
    // Memory is back. Writes stay refused; the first failure is the one told.
    const std::string first = KovPager::instance()->failure();
    EXPECT_EQ(countEntries(keeper), 1000);
    fill(keeper, 5000, 10, 10);
    EXPECT_EQ(countEntries(keeper), 1000);
    EXPECT_EQ(KovPager::instance()->failure(), first);
    expectFreshStoreWorks();
}

// The temporary directory removed after it was chosen, before the store wanted its file: the
// insert that wanted it is refused and the host is told why and where (on every platform); what
// the store held reads back; after reset() a store that needs no file works.
TEST_F(PagerFailure, TemporaryDirectoryRemovedSinceItWasChosenIsTold) {
    const std::string gone = kov::test::vanishedDirectory("kov-gone-");
    ASSERT_FALSE(gone.empty());
    {
        TempDirOverride over(gone);
        KovPager::instance()->reset();
        KovBtree table(KovBtree::IntKeyTable);
        // A cache of 200 pages: the file is wanted after a few hundred records.
        kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), 200);
        KovBtreeCursor c(table, true);
        const std::int64_t k = insertUntilFailed(c, 1000);
        ASSERT_TRUE(KovPager::instance()->failed());
        EXPECT_GT(k, 50);
        const std::string text = KovPager::instance()->failure();
        EXPECT_TRUE(contains(text, "while inserting an entry: unable to open database file (SQLite "
                                   "result code 14): cannot make a file in " + gone + ": "))
            << text;
        EXPECT_TRUE(contains(text, "; temporary directory: " + gone + ".")) << text;
        EXPECT_EQ(countEntries(c), k - 1);
    }
    expectFreshStoreWorks();
}
