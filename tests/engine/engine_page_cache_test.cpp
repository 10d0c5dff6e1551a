// The private SQLite's page cache (engine/page_cache.cpp): its methods
// driven directly, as SQLite drives them, against a model of what each
// page must hold; then the cache under the engine, where a random seek in a
// table larger than the cache must read about one page from the file.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine/page_cache.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"
#include "fault_vfs.h"

namespace {

using namespace kov::engine;        // NOLINT(google-build-using-namespace)
using namespace kov::engine::test;  // NOLINT(google-build-using-namespace)

constexpr int kPageSize = 1024;
constexpr int kExtraSize = 72;  // not a multiple of 16: the area is used as given
constexpr unsigned char kInteriorTable = 0x05;
constexpr unsigned char kInteriorIndex = 0x02;
constexpr unsigned char kLeafTable = 0x0d;
constexpr unsigned char kLeafIndex = 0x0a;

// One cache made through the methods, destroyed with it.
class Cache {
  public:
    Cache(bool purgeable, int budget) : m_(pageCacheMethods()) {
        // The cache allocates through SQLite, which initialises on its first
        // allocation and takes no page cache after that: installed first, so
        // that the engine test in the same program finds it in place.
        installPageCache();
        cache_ = m_.xCreate(kPageSize, kExtraSize, purgeable ? 1 : 0);
        if (cache_ != nullptr)
            m_.xCachesize(cache_, budget);
    }
    ~Cache() {
        if (cache_ != nullptr)
            m_.xDestroy(cache_);
    }
    Cache(const Cache&) = delete;
    Cache& operator=(const Cache&) = delete;

    bool ok() const { return cache_ != nullptr; }
    sqlite3_pcache_page* fetch(unsigned key, int createFlag) {
        return m_.xFetch(cache_, key, createFlag);
    }
    void unpin(sqlite3_pcache_page* p, bool discard = false) { m_.xUnpin(cache_, p, discard ? 1 : 0); }
    // Writes a page-type byte, as SQLite would have before unpinning, then unpins.
    void unpinAs(sqlite3_pcache_page* p, unsigned key, unsigned char type) {
        static_cast<unsigned char*>(p->pBuf)[key == 1 ? 100 : 0] = type;
        unpin(p);
    }
    void rekey(sqlite3_pcache_page* p, unsigned from, unsigned to) { m_.xRekey(cache_, p, from, to); }
    void truncate(unsigned limit) { m_.xTruncate(cache_, limit); }
    void shrink() { m_.xShrink(cache_); }
    void cachesize(int n) { m_.xCachesize(cache_, n); }
    int pages() { return m_.xPagecount(cache_); }

    // Makes a page and unpins it as the given type; false when refused.
    bool add(unsigned key, unsigned char type) {
        sqlite3_pcache_page* p = fetch(key, 2);
        if (p == nullptr)
            return false;
        unpinAs(p, key, type);
        return true;
    }
    bool holds(unsigned key) {
        sqlite3_pcache_page* p = fetch(key, 0);
        if (p == nullptr)
            return false;
        unpin(p);  // back to the front of its list: callers mind the order
        return true;
    }

  private:
    const sqlite3_pcache_methods2& m_;
    sqlite3_pcache* cache_ = nullptr;
};

bool extraIsZero(const sqlite3_pcache_page* p) {
    const auto* e = static_cast<const unsigned char*>(p->pExtra);
    return std::all_of(e, e + kExtraSize, [](unsigned char b) { return b == 0; });
}

TEST(PageCache, CreateFlagZeroNeverMakesAPageAndAHitReturnsTheSamePage) {
    Cache c(true, 20);
    ASSERT_TRUE(c.ok());
    EXPECT_EQ(c.fetch(7, 0), nullptr);
    EXPECT_EQ(c.pages(), 0);
    sqlite3_pcache_page* p = c.fetch(7, 1);
    ASSERT_NE(p, nullptr);
    EXPECT_TRUE(extraIsZero(p));
    EXPECT_EQ(c.pages(), 1);
    std::memset(p->pBuf, 0x5a, kPageSize);
    std::memset(p->pExtra, 0xa5, kExtraSize);
    EXPECT_EQ(c.fetch(7, 0), p);  // pinned twice: no reference counting
    EXPECT_EQ(c.fetch(7, 2), p);
    c.unpin(p);  // one unpin unpins
    sqlite3_pcache_page* again = c.fetch(7, 0);
    ASSERT_EQ(again, p);
    EXPECT_EQ(static_cast<unsigned char*>(p->pBuf)[kPageSize - 1], 0x5a);
    EXPECT_EQ(static_cast<unsigned char*>(p->pExtra)[kExtraSize - 1], 0xa5);
    c.unpin(p, true);
    EXPECT_EQ(c.pages(), 0);
    EXPECT_EQ(c.fetch(7, 0), nullptr);
}

TEST(PageCache, RecycledPageComesBackWithItsExtraBytesCleared) {
    Cache c(true, 10);
    ASSERT_TRUE(c.ok());
    for (unsigned k = 1; k <= 10; ++k) {
        sqlite3_pcache_page* p = c.fetch(k, 2);
        ASSERT_NE(p, nullptr);
        std::memset(p->pExtra, 0xff, kExtraSize);
        c.unpinAs(p, k, kLeafTable);
    }
    sqlite3_pcache_page* p = c.fetch(11, 2);
    ASSERT_NE(p, nullptr);
    EXPECT_TRUE(extraIsZero(p));
    EXPECT_EQ(c.pages(), 10);
    EXPECT_EQ(c.fetch(1, 0), nullptr);  // the least recently used leaf went
    c.unpin(p);
}

TEST(PageCache, NonPurgeableCacheKeepsEveryPageWhateverTheBudget) {
    Cache c(false, 5);
    ASSERT_TRUE(c.ok());
    std::vector<sqlite3_pcache_page*> held;
    for (unsigned k = 1; k <= 300; ++k) {  // past the first hash table too
        sqlite3_pcache_page* p = c.fetch(k, 2);
        ASSERT_NE(p, nullptr);
        std::memcpy(p->pBuf, &k, sizeof k);
        held.push_back(p);
    }
    EXPECT_EQ(c.pages(), 300);
    c.shrink();
    c.cachesize(1);
    EXPECT_EQ(c.pages(), 300);
    for (unsigned k = 1; k <= 300; ++k) {
        sqlite3_pcache_page* p = c.fetch(k, 0);
        ASSERT_EQ(p, held[k - 1]);
        unsigned stored = 0;
        std::memcpy(&stored, p->pBuf, sizeof stored);
        EXPECT_EQ(stored, k);
    }
    c.unpin(held[9], true);
    EXPECT_EQ(c.pages(), 299);
    c.truncate(101);
    EXPECT_EQ(c.pages(), 99);
    EXPECT_EQ(c.fetch(150, 0), nullptr);
}

TEST(PageCache, CreateFlagOneRefusesWhenNineTenthsArePinned) {
    Cache c(true, 20);
    ASSERT_TRUE(c.ok());
    std::vector<sqlite3_pcache_page*> pinned;
    for (unsigned k = 1; k <= 17; ++k)
        pinned.push_back(c.fetch(k, 1));
    EXPECT_NE(c.fetch(18, 1), nullptr);  // 17 pinned < 18
    EXPECT_EQ(c.fetch(19, 1), nullptr);  // 18 pinned = 9/10 of 20
    EXPECT_NE(c.fetch(19, 2), nullptr);  // 2 makes the page
    EXPECT_EQ(c.pages(), 19);
}

TEST(PageCache, PastTheBudgetOnlyWhileEveryPageIsPinnedAndFreedOnUnpin) {
    Cache c(true, 10);
    ASSERT_TRUE(c.ok());
    std::vector<sqlite3_pcache_page*> pinned;
    for (unsigned k = 1; k <= 14; ++k) {
        sqlite3_pcache_page* p = c.fetch(k, 2);
        ASSERT_NE(p, nullptr);
        pinned.push_back(p);
    }
    EXPECT_EQ(c.pages(), 14);
    for (unsigned k = 1; k <= 14; ++k)
        c.unpinAs(pinned[k - 1], k, kLeafTable);
    EXPECT_EQ(c.pages(), 10);  // the first four unpins freed their pages
    EXPECT_EQ(c.fetch(1, 0), nullptr);
    EXPECT_TRUE(c.holds(14));
    c.cachesize(3);
    EXPECT_EQ(c.pages(), 3);
    c.shrink();
    EXPECT_EQ(c.pages(), 0);
}

TEST(PageCache, InteriorPagesAreKeptWhileLeavesStreamThrough) {
    Cache c(true, 100);
    ASSERT_TRUE(c.ok());
    for (unsigned k = 1; k <= 40; ++k)
        ASSERT_TRUE(c.add(k, k % 2 ? kInteriorTable : kInteriorIndex));
    for (unsigned k = 1000; k < 6000; ++k) {
        ASSERT_TRUE(c.add(k, k % 2 ? kLeafTable : kLeafIndex));
        ASSERT_LE(c.pages(), 100);
    }
    for (unsigned k = 1; k <= 40; ++k)
        EXPECT_TRUE(c.holds(k)) << "interior page " << k;
    // The leaves share what is left, most recent first.
    EXPECT_TRUE(c.holds(5999));
    EXPECT_FALSE(c.holds(5999 - 60));
}

TEST(PageCache, PageOneIsClassifiedByTheByteAfterTheFileHeader) {
    Cache c(true, 10);
    ASSERT_TRUE(c.ok());
    sqlite3_pcache_page* p = c.fetch(1, 2);
    ASSERT_NE(p, nullptr);
    static_cast<unsigned char*>(p->pBuf)[0] = kLeafTable;  // the file header's first byte
    c.unpinAs(p, 1, kInteriorTable);                        // byte 100
    for (unsigned k = 2; k < 200; ++k)
        ASSERT_TRUE(c.add(k, kLeafTable));
    EXPECT_TRUE(c.holds(1));
}

TEST(PageCache, WithAShareSetInteriorPagesHoldAtMostThatShare) {
    const int previous = TEST_setInteriorSharePercent(75);
    Cache c(true, 100);
    ASSERT_TRUE(c.ok());
    for (unsigned k = 1; k <= 95; ++k)
        ASSERT_TRUE(c.add(k, kInteriorTable));
    for (unsigned k = 1000; k < 1200; ++k)
        ASSERT_TRUE(c.add(k, kLeafTable));
    EXPECT_EQ(c.pages(), 100);
    int interior = 0;
    for (unsigned k = 1; k <= 95; ++k) {
        sqlite3_pcache_page* p = c.fetch(k, 0);
        if (p != nullptr) {
            ++interior;
            c.unpinAs(p, k, kInteriorTable);
        }
    }
    EXPECT_EQ(interior, 75);
    EXPECT_FALSE(c.holds(20));  // the least recently used ones went
    EXPECT_TRUE(c.holds(95));
    TEST_setInteriorSharePercent(previous);
}

TEST(PageCache, InteriorPagesMayFillTheBudgetLeavingOneLeafPage) {
    {
        Cache c(true, 50);
        ASSERT_TRUE(c.ok());
        for (unsigned k = 1; k <= 50; ++k)
            ASSERT_TRUE(c.add(k, kInteriorTable));
        for (unsigned k = 1000; k < 1100; ++k)
            ASSERT_TRUE(c.add(k, kLeafTable));  // each takes the one leaf's place
        int interior = 0;
        for (unsigned k = 1; k <= 50; ++k)
            interior += c.holds(k) ? 1 : 0;
        EXPECT_EQ(interior, 49);
    }
}

TEST(PageCache, CreateFlagOneRefusesWhenOnlyInteriorPagesCouldBeRecycled) {
    Cache c(true, 20);
    ASSERT_TRUE(c.ok());
    for (unsigned k = 1; k <= 10; ++k)
        ASSERT_TRUE(c.add(k, kInteriorTable));
    std::vector<sqlite3_pcache_page*> pinned;
    for (unsigned k = 11; k <= 20; ++k)
        pinned.push_back(c.fetch(k, 1));  // modified pages stay pinned
    EXPECT_EQ(c.fetch(21, 1), nullptr);   // SQLite writes a modified page out instead
    c.unpinAs(pinned[0], 11, kLeafTable); // ... which comes back clean
    sqlite3_pcache_page* p = c.fetch(21, 2);
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(c.fetch(11, 0), nullptr);  // the leaf's buffer was taken
    for (unsigned k = 1; k <= 10; ++k)
        EXPECT_TRUE(c.holds(k));  // page 1 is now the least recently used
    // With createFlag 2 and no leaf to take, an interior page goes.
    EXPECT_NE(c.fetch(22, 2), nullptr);
    EXPECT_EQ(c.pages(), 20);
    EXPECT_EQ(c.fetch(1, 0), nullptr);
    EXPECT_TRUE(c.holds(2));
    c.unpin(p);
}

TEST(PageCache, RekeyMovesThePageAndDropsWhatHeldTheNewKey) {
    Cache c(true, 20);
    ASSERT_TRUE(c.ok());
    ASSERT_TRUE(c.add(5, kLeafTable));
    sqlite3_pcache_page* p = c.fetch(3, 2);
    ASSERT_NE(p, nullptr);
    std::memset(p->pBuf, 0x33, kPageSize);
    c.rekey(p, 3, 5);
    EXPECT_EQ(c.pages(), 1);
    EXPECT_EQ(c.fetch(3, 0), nullptr);
    EXPECT_EQ(c.fetch(5, 0), p);
    c.rekey(p, 5, 700);  // past every key so far: a truncation must still find it
    c.unpinAs(p, 700, kLeafTable);
    c.truncate(600);
    EXPECT_EQ(c.pages(), 0);
}

TEST(PageCache, TruncateDropsPinnedAndUnpinnedPagesFromTheLimitOn) {
    Cache c(true, 1000);
    ASSERT_TRUE(c.ok());
    // Keys ten apart, so that a truncation can span more keys than the hash
    // table has slots.
    for (unsigned i = 1; i <= 600; ++i) {
        const unsigned k = i * 10;
        sqlite3_pcache_page* p = c.fetch(k, 2);
        ASSERT_NE(p, nullptr);
        if (i % 3 == 0)
            c.unpinAs(p, k, i % 2 ? kInteriorTable : kLeafTable);
    }
    c.truncate(5901);  // a few keys: only their slots are looked at
    EXPECT_EQ(c.pages(), 590);
    c.truncate(1000);  // many keys: the whole table
    EXPECT_EQ(c.pages(), 99);
    for (unsigned i = 1; i <= 600; ++i)
        EXPECT_EQ(c.fetch(i * 10, 0) != nullptr, i * 10 < 1000) << i * 10;
    c.truncate(7000);  // nothing there
    EXPECT_EQ(c.pages(), 99);
}

// Random calls in the ways SQLite makes them, checked against a model: a
// pinned page is always there with its content; an unpinned one is there
// with its content or gone; a discarded or truncated one is gone; a
// purgeable cache is never past its budget while it has an unpinned page.
void randomRun(bool purgeable, std::uint32_t seed) {
    struct Held {
        sqlite3_pcache_page* page;
        std::uint32_t stamp;
        bool pinned;
    };
    std::mt19937 rng(seed);
    int budget = 40;
    Cache c(purgeable, budget);
    ASSERT_TRUE(c.ok());
    std::map<unsigned, Held> model;
    std::uint32_t nextStamp = 1;
    const auto stampOf = [](const sqlite3_pcache_page* p) {
        std::uint32_t s = 0;
        std::memcpy(&s, static_cast<const unsigned char*>(p->pBuf) + 4, sizeof s);
        return s;
    };
    const auto pick = [&rng](unsigned n) {
        return std::uniform_int_distribution<unsigned>(0, n - 1)(rng);
    };
    const auto pinnedCount = [&model] {
        int n = 0;
        for (const auto& e : model)
            n += e.second.pinned ? 1 : 0;
        return n;
    };

    for (int step = 0; step < 20000; ++step) {
        SCOPED_TRACE("seed " + std::to_string(seed) + " step " + std::to_string(step));
        const unsigned op = pick(100);
        const unsigned key = 1 + pick(120);
        if (op < 55) {  // fetch
            // A cache for a memory database is asked with createFlag 2 only.
            const int flag = purgeable ? static_cast<int>(pick(3)) : 2 * static_cast<int>(pick(2));
            sqlite3_pcache_page* p = c.fetch(key, flag);
            auto it = model.find(key);
            if (it != model.end() && p == nullptr) {
                // Only an unpinned page may have gone, and only from a purgeable cache.
                ASSERT_TRUE(purgeable && !it->second.pinned);
                model.erase(it);
                it = model.end();
                if (flag == 0)
                    continue;
                p = c.fetch(key, 2);
                ASSERT_NE(p, nullptr);
            }
            if (p == nullptr) {
                ASSERT_NE(flag, 2);
                continue;
            }
            const std::uint32_t extraStamp = *static_cast<std::uint32_t*>(p->pExtra);
            if (it != model.end() && extraStamp == 0) {
                // A new page for a key whose unpinned page had gone.
                ASSERT_TRUE(purgeable && !it->second.pinned);
                model.erase(it);
                it = model.end();
            }
            if (it == model.end()) {
                ASSERT_NE(flag, 0);
                ASSERT_TRUE(extraIsZero(p));
                const std::uint32_t stamp = nextStamp++;
                std::memcpy(static_cast<unsigned char*>(p->pBuf) + 4, &stamp, sizeof stamp);
                std::memcpy(p->pExtra, &stamp, sizeof stamp);
                model[key] = Held{p, stamp, true};
            } else {
                ASSERT_EQ(p, it->second.page);
                ASSERT_EQ(stampOf(p), it->second.stamp);
                ASSERT_EQ(extraStamp, it->second.stamp);
                it->second.pinned = true;
            }
        } else if (op < 85) {  // unpin one pinned page
            std::vector<unsigned> pinned;
            for (const auto& e : model) {
                if (e.second.pinned)
                    pinned.push_back(e.first);
            }
            if (pinned.empty())
                continue;
            const unsigned k = pinned[pick(static_cast<unsigned>(pinned.size()))];
            const bool discard = !purgeable || pick(8) == 0;
            static const unsigned char kTypes[] = {kInteriorTable, kInteriorIndex, kLeafTable,
                                                   kLeafIndex, 0};
            static_cast<unsigned char*>(model[k].page->pBuf)[k == 1 ? 100 : 0] = kTypes[pick(5)];
            c.unpin(model[k].page, discard);
            if (discard)
                model.erase(k);
            else
                model[k].pinned = false;
        } else if (op < 90) {  // rekey a pinned page to a key that is free or unpinned
            std::vector<unsigned> pinned;
            for (const auto& e : model) {
                if (e.second.pinned)
                    pinned.push_back(e.first);
            }
            auto target = model.find(key);
            if (pinned.empty() || (target != model.end() && target->second.pinned))
                continue;
            const unsigned k = pinned[pick(static_cast<unsigned>(pinned.size()))];
            if (target != model.end())
                model.erase(target);
            c.rekey(model[k].page, k, key);
            model[key] = model[k];
            model.erase(k);
        } else if (op < 93) {  // truncate
            const unsigned limit = 1 + pick(130);
            c.truncate(limit);
            model.erase(model.lower_bound(limit), model.end());
        } else if (op < 95) {
            c.shrink();
        } else if (op < 97) {
            budget = 5 + static_cast<int>(pick(60));
            c.cachesize(budget);
        } else {  // every page the model holds pinned is there
            for (const auto& e : model) {
                if (e.second.pinned) {
                    ASSERT_EQ(c.fetch(e.first, 0), e.second.page);
                }
            }
        }
        const int pages = c.pages();
        const int pinnedNow = pinnedCount();
        ASSERT_GE(pages, pinnedNow);
        ASSERT_LE(pages, static_cast<int>(model.size()));
        if (purgeable) {
            ASSERT_TRUE(pages <= budget || pages == pinnedNow) << pages << " pages, budget " << budget;
        } else {
            ASSERT_EQ(pages, static_cast<int>(model.size()));
        }
    }
}

TEST(PageCache, RandomCallsOnAPurgeableCacheKeepToTheModel) {
    for (std::uint32_t seed : {1u, 2u, 3u, 20240601u})
        randomRun(true, seed);
}

TEST(PageCache, RandomCallsOnANonPurgeableCacheKeepToTheModel) {
    for (std::uint32_t seed : {4u, 5u})
        randomRun(false, seed);
}

// The cache under the engine: with the cache a tenth of the table, and keys
// long enough that the interior pages are a good part of the cache, a
// random seek reads its leaf and hardly ever anything else.
TEST(PageCacheEngine, RandomSeeksPastTheCacheReadAboutOnePageEach) {
    // Before anything initialises the private SQLite (the VFS below would).
    ASSERT_TRUE(installPageCache());
    kov::test::ScopedFaultVfs vfs;
    ASSERT_EQ(vfs.registerRc(), SQLITE_OK);
    constexpr int kCachePages = 300;
    constexpr int kRecords = 40000;
    constexpr int kSeeks = 4000;
    const auto keyOf = [](int i) {
        std::string key = patternBytes(200, static_cast<unsigned>(i));
        std::memcpy(key.data(), &i, sizeof i);  // distinct whatever the pattern
        return key;
    };

    TestEngine engine;
    ASSERT_EQ(engine.beginRc, SQLITE_OK);
    ASSERT_TRUE(pageCacheActive());
    ASSERT_EQ(sqlite3BtreeSetCacheSize(engine.get(), kCachePages), SQLITE_OK);
    const std::uint32_t root = engine.createTable(kKeyOnlyTable);
    ASSERT_NE(root, 0u);
    std::vector<int> order(kRecords);
    for (int i = 0; i < kRecords; ++i)
        order[static_cast<std::size_t>(i)] = i;
    std::mt19937 rng(7);
    std::shuffle(order.begin(), order.end(), rng);
    {
        TestCursor cur(engine.get(), root, 1);
        ASSERT_EQ(cur.rc, SQLITE_OK);
        for (int i : order)
            ASSERT_EQ(insertBytes(cur.get(), keyOf(i)), SQLITE_OK);
    }
    {
        TestCursor cur(engine.get(), root, 0);
        ASSERT_EQ(cur.rc, SQLITE_OK);
        // Warm the cache up first, then count.
        std::uniform_int_distribution<int> any(0, kRecords - 1);
        for (int i = 0; i < kSeeks; ++i)
            ASSERT_EQ(seekBytes(cur.get(), keyOf(any(rng))), 0);
        vfs.faults().resetCounters();
        const PageCacheCounters before = pageCacheCounters();
        for (int i = 0; i < kSeeks; ++i)
            ASSERT_EQ(seekBytes(cur.get(), keyOf(any(rng))), 0);
        const PageCacheCounters after = pageCacheCounters();
        const double readsPerSeek =
            static_cast<double>(vfs.faults().calls(kov::test::FaultKind::Read)) / kSeeks;
        const double missesPerSeek = static_cast<double>(after.misses - before.misses) / kSeeks;
        // 200-byte keys: about 18 to a page, so some 2200 leaves and 130
        // interior pages. The cache holds every interior page and 170 leaves:
        // a seek misses on its leaf about 92 times in 100, and on nothing else.
        EXPECT_GT(readsPerSeek, 0.8);
        EXPECT_LT(readsPerSeek, 1.0);
        EXPECT_NEAR(missesPerSeek, readsPerSeek, 0.01);
        EXPECT_EQ(after.recycledInterior, before.recycledInterior);
    }
    EXPECT_EQ(integrityProblems(engine.get()), "");
    EXPECT_EQ(engine.close(), SQLITE_OK);
}

}  // namespace
