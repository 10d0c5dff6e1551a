// Tests of the engine binding: each numbered rule of engine/btree.h, the
// handle rules, and the entry shapes the store produces (key and data
// lengths, integer keys at their limits, random byte-string keys).
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <limits>
#include <map>
#include <memory>
#include <random>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "engine/btree.h"
#include "engine_temp_dir.h"
#include "engine_test_util.h"

namespace {

using namespace kov::engine;        // NOLINT(google-build-using-namespace)
using namespace kov::engine::test;  // NOLINT(google-build-using-namespace)

constexpr int kFlagSentinel = 0x5a5a;
constexpr char kFill = static_cast<char>(0xA5);

// A std::string made of raw bytes given as a literal with its length, so
// that embedded 0x00 bytes are kept.
template <std::size_t N>
std::string bytes(const char (&s)[N]) {
    return std::string(s, N - 1);
}

// Reads `amt` key bytes from `offset` into a buffer pre-filled with kFill.
std::pair<int, std::string> readKey(BtCursor* cur, std::uint32_t offset, std::uint32_t amt,
                                    std::size_t bufSize) {
    std::string buf(bufSize, kFill);
    int rc = sqlite3BtreeKey(cur, offset, amt, buf.data());
    return {rc, buf};
}

std::pair<int, std::string> readData(BtCursor* cur, std::uint32_t offset, std::uint32_t amt,
                                     std::size_t bufSize) {
    std::string buf(bufSize, kFill);
    int rc = sqlite3BtreeData(cur, offset, amt, buf.data());
    return {rc, buf};
}

// The expected buffer after a read of `amt` bytes of `src` from `offset`
// into a kFill buffer of `bufSize` bytes.
std::string expectedRead(const std::string& src, std::size_t offset, std::size_t amt,
                         std::size_t bufSize) {
    std::string buf(bufSize, kFill);
    std::copy(src.begin() + static_cast<std::ptrdiff_t>(offset),
              src.begin() + static_cast<std::ptrdiff_t>(offset + amt), buf.begin());
    return buf;
}

// A random key of length 0..40 whose bytes favour 0x00, 0x01, 0x7F, 0x80,
// 0xFE and 0xFF, so that keys share prefixes and hit the byte extremes.
std::string randomKey(std::mt19937_64& rng) {
    static const unsigned char kEdgeBytes[] = {0x00, 0x01, 0x7f, 0x80, 0xfe, 0xff};
    std::size_t len = static_cast<std::size_t>(rng() % 41);
    std::string key(len, '\0');
    for (auto& c : key) {
        std::uint64_t r = rng();
        if (r % 3 == 0)
            c = static_cast<char>(kEdgeBytes[(r >> 8) % 6]);
        else
            c = static_cast<char>((r >> 16) & 0xff);
    }
    return key;
}

// ---------------------------------------------------------------------------
// Opening the engine the way the store does.

TEST(EngineOpen, StoreSettingsSucceed) {
    TestEngine engine;
    ASSERT_EQ(engine.openRc, SQLITE_OK);
    ASSERT_NE(engine.get(), nullptr);
    EXPECT_EQ(engine.pageSizeRc, SQLITE_OK);
    EXPECT_EQ(engine.cacheSizeRc, SQLITE_OK);
    EXPECT_EQ(engine.beginRc, SQLITE_OK);
    EXPECT_EQ(engine.close(), SQLITE_OK);
}

// Counts below 10 pages are taken as 10; others as they are.
TEST(EngineOpen, CacheSizeAcceptsSmallAndLargeCounts) {
    TestEngine engine;
    ASSERT_NE(engine.get(), nullptr);
    EXPECT_EQ(sqlite3BtreeSetCacheSize(engine.get(), 0), SQLITE_OK);
    EXPECT_EQ(TEST_pragmaValue(engine.get(), "PRAGMA cache_size"), 10);
    EXPECT_EQ(sqlite3BtreeSetCacheSize(engine.get(), 5), SQLITE_OK);
    EXPECT_EQ(TEST_pragmaValue(engine.get(), "PRAGMA cache_size"), 10);
    EXPECT_EQ(sqlite3BtreeSetCacheSize(engine.get(), 16384), SQLITE_OK);
    EXPECT_EQ(TEST_pragmaValue(engine.get(), "PRAGMA cache_size"), 16384);
    // The engine keeps working with the smallest cache.
    EXPECT_EQ(sqlite3BtreeSetCacheSize(engine.get(), 1), SQLITE_OK);
    EXPECT_EQ(TEST_pragmaValue(engine.get(), "PRAGMA cache_size"), 10);
    std::uint32_t root = engine.createTable(kIntTable);
    ASSERT_NE(root, 0u);
    TestCursor cur(engine.get(), root, 1);
    for (std::int64_t k = 0; k < 500; ++k)
        ASSERT_EQ(insertInt(cur.get(), k, patternBytes(300, static_cast<unsigned>(k))), SQLITE_OK);
    auto all = walkInts(cur.get());
    ASSERT_EQ(all.size(), 500u);
    for (std::int64_t k = 0; k < 500; ++k) {
        EXPECT_EQ(all[static_cast<std::size_t>(k)].first, k);
        EXPECT_EQ(all[static_cast<std::size_t>(k)].second,
                  patternBytes(300, static_cast<unsigned>(k)));
    }
}

TEST(EngineOpen, TablesOfEachKindAreIndependent) {
    TestEngine engine;
    std::uint32_t bytesRoot = engine.createTable(kByteTable);
    std::uint32_t intRoot = engine.createTable(kIntTable);
    std::uint32_t keyRoot = engine.createTable(kKeyOnlyTable);
    ASSERT_NE(bytesRoot, 0u);
    ASSERT_NE(intRoot, 0u);
    ASSERT_NE(keyRoot, 0u);
    EXPECT_NE(bytesRoot, intRoot);
    EXPECT_NE(bytesRoot, keyRoot);
    EXPECT_NE(intRoot, keyRoot);
    {
        TestCursor b(engine.get(), bytesRoot, 1);
        TestCursor i(engine.get(), intRoot, 1);
        TestCursor k(engine.get(), keyRoot, 1);
        ASSERT_EQ(insertBytes(b.get(), "b", "bd"), SQLITE_OK);
        ASSERT_EQ(insertInt(i.get(), 7, "id"), SQLITE_OK);
        ASSERT_EQ(insertBytes(k.get(), "k"), SQLITE_OK);
        auto bAll = walkBytes(b.get());
        auto iAll = walkInts(i.get());
        auto kAll = walkBytes(k.get());
        ASSERT_EQ(bAll.size(), 1u);
        EXPECT_EQ(bAll[0], std::make_pair(std::string("b"), std::string("bd")));
        ASSERT_EQ(iAll.size(), 1u);
        EXPECT_EQ(iAll[0], std::make_pair(std::int64_t{7}, std::string("id")));
        ASSERT_EQ(kAll.size(), 1u);
        EXPECT_EQ(kAll[0], std::make_pair(std::string("k"), std::string()));
    }
}

// ---------------------------------------------------------------------------
// Null handles: SQLITE_MISUSE, no out-value written, no crash.

TEST(EngineNullHandle, EngineOperationsReturnMisuseAndWriteNothing) {
    EXPECT_EQ(sqlite3BtreeClose(nullptr), SQLITE_MISUSE);
    EXPECT_EQ(sqlite3BtreeSetCacheSize(nullptr, 100), SQLITE_MISUSE);
    EXPECT_EQ(sqlite3BtreeSetPageSize(nullptr, 4096, -1), SQLITE_MISUSE);
    EXPECT_EQ(sqlite3BtreeBeginTrans(nullptr, 2), SQLITE_MISUSE);

    std::uint32_t root = 0xdeadbeefu;
    EXPECT_EQ(sqlite3BtreeCreateTable(nullptr, &root, kByteTable), SQLITE_MISUSE);
    EXPECT_EQ(root, 0xdeadbeefu);

    int moved = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeDropTable(nullptr, 2, &moved), SQLITE_MISUSE);
    EXPECT_EQ(moved, kFlagSentinel);

    int marker = 0;
    BtCursor* cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(nullptr, 2, 1, nullptr, nullptr, &cur), SQLITE_MISUSE);
    EXPECT_EQ(cur, reinterpret_cast<BtCursor*>(&marker));
    EXPECT_EQ(sqlite3BtreeCursor(nullptr, 2, 0, nullptr, nullptr, &cur), SQLITE_MISUSE);
    EXPECT_EQ(cur, reinterpret_cast<BtCursor*>(&marker));
}

TEST(EngineNullHandle, CursorOperationsReturnMisuseAndWriteNothing) {
    EXPECT_EQ(sqlite3BtreeCloseCursor(nullptr), SQLITE_MISUSE);

    int flag = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeFirst(nullptr, &flag), SQLITE_MISUSE);
    EXPECT_EQ(flag, kFlagSentinel);
    EXPECT_EQ(sqlite3BtreeLast(nullptr, &flag), SQLITE_MISUSE);
    EXPECT_EQ(flag, kFlagSentinel);
    EXPECT_EQ(sqlite3BtreeNext(nullptr, &flag), SQLITE_MISUSE);
    EXPECT_EQ(flag, kFlagSentinel);
    EXPECT_EQ(sqlite3BtreePrevious(nullptr, &flag), SQLITE_MISUSE);
    EXPECT_EQ(flag, kFlagSentinel);

    EXPECT_EQ(sqlite3BtreeEof(nullptr), SQLITE_MISUSE);

    int res = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeMoveto(nullptr, "abc", 3, &res), SQLITE_MISUSE);
    EXPECT_EQ(res, kFlagSentinel);
    EXPECT_EQ(sqlite3BtreeMoveto(nullptr, nullptr, 5, &res), SQLITE_MISUSE);
    EXPECT_EQ(res, kFlagSentinel);

    std::int64_t keySize = 0x1234567890LL;
    EXPECT_EQ(sqlite3BtreeKeySize(nullptr, &keySize), SQLITE_MISUSE);
    EXPECT_EQ(keySize, 0x1234567890LL);

    std::uint32_t dataSize = 0xdeadbeefu;
    EXPECT_EQ(sqlite3BtreeDataSize(nullptr, &dataSize), SQLITE_MISUSE);
    EXPECT_EQ(dataSize, 0xdeadbeefu);

    auto key = readKey(nullptr, 0, 4, 8);
    EXPECT_EQ(key.first, SQLITE_MISUSE);
    EXPECT_EQ(key.second, std::string(8, kFill));
    auto data = readData(nullptr, 0, 4, 8);
    EXPECT_EQ(data.first, SQLITE_MISUSE);
    EXPECT_EQ(data.second, std::string(8, kFill));
    EXPECT_EQ(sqlite3BtreeKey(nullptr, 0, 0, nullptr), SQLITE_MISUSE);
    EXPECT_EQ(sqlite3BtreeData(nullptr, 0, 0, nullptr), SQLITE_MISUSE);

    EXPECT_EQ(sqlite3BtreeInsert(nullptr, "k", 1, "d", 1), SQLITE_MISUSE);
    EXPECT_EQ(sqlite3BtreeInsert(nullptr, nullptr, 1, "d", 1), SQLITE_MISUSE);
}

TEST(EngineCursor, ComparisonFunctionRefusedWithMisuse) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    ASSERT_NE(root, 0u);
    BtreeCompare cmp = [](void*, int, const void*, int, const void*) { return 0; };
    int marker = 0;
    BtCursor* cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root, 1, cmp, nullptr, &cur), SQLITE_MISUSE);
    EXPECT_EQ(cur, nullptr);
    // The refusal left no cursor behind: tables can still be created.
    EXPECT_NE(engine.createTable(kByteTable), 0u);
}

// ---------------------------------------------------------------------------
// Rule 1: key order.

TEST(EngineKeyOrder, ByteKeysCompareUnsignedThenShorterFirst) {
    // Written out in the required order.
    const std::vector<std::string> ordered = {
        bytes(""),         bytes("\x00"), bytes("\x00\x00"), bytes("\x00\x01"),
        bytes("\x01"),     bytes("a"),    bytes("a\x00"),    bytes("a\x00z"),
        bytes("ab"),       bytes("b"),    bytes("\x7f"),     bytes("\x80"),
        bytes("\xfe\xff"), bytes("\xff"), bytes("\xff\x00"), bytes("\xff\xff"),
    };
    for (int flags : {kByteTable, kKeyOnlyTable}) {
        TestEngine engine;
        std::uint32_t root = engine.createTable(flags);
        ASSERT_NE(root, 0u);
        TestCursor cur(engine.get(), root, 1);
        std::vector<std::string> shuffled = ordered;
        std::mt19937 rng(7);
        std::shuffle(shuffled.begin(), shuffled.end(), rng);
        for (const auto& k : shuffled)
            ASSERT_EQ(insertBytes(cur.get(), k, "d" + k), SQLITE_OK);
        auto all = walkBytes(cur.get());
        ASSERT_EQ(all.size(), ordered.size()) << "flags " << flags;
        for (std::size_t i = 0; i < ordered.size(); ++i)
            EXPECT_EQ(all[i].first, ordered[i]) << "position " << i << " flags " << flags;
    }
}

TEST(EngineKeyOrder, IntegerKeysCompareAsSigned64Bit) {
    const std::vector<std::int64_t> ordered = {std::numeric_limits<std::int64_t>::min(), -1, 0, 1,
                                               std::numeric_limits<std::int64_t>::max()};
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    ASSERT_NE(root, 0u);
    TestCursor cur(engine.get(), root, 1);
    for (std::int64_t k :
         {std::int64_t{1}, std::numeric_limits<std::int64_t>::max(), std::int64_t{-1},
          std::numeric_limits<std::int64_t>::min(), std::int64_t{0}})
        ASSERT_EQ(insertInt(cur.get(), k, "v" + std::to_string(k)), SQLITE_OK);

    // Forward from First.
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    for (std::size_t i = 0; i < ordered.size(); ++i) {
        ASSERT_EQ(res, 0) << "position " << i;
        EXPECT_EQ(currentIntKey(cur.get()), ordered[i]);
        EXPECT_EQ(currentData(cur.get()), "v" + std::to_string(ordered[i]));
        ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    }
    EXPECT_EQ(res, 1);

    // Backward from Last.
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    for (std::size_t i = ordered.size(); i-- > 0;) {
        ASSERT_EQ(res, 0) << "position " << i;
        EXPECT_EQ(currentIntKey(cur.get()), ordered[i]);
        ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    }
    EXPECT_EQ(res, 1);

    // Seeking each key lands on it exactly; KeySize gives the key itself.
    for (std::int64_t k : ordered) {
        EXPECT_EQ(seekInt(cur.get(), k), 0) << k;
        std::int64_t got = 12345;
        ASSERT_EQ(sqlite3BtreeKeySize(cur.get(), &got), SQLITE_OK);
        EXPECT_EQ(got, k);
        std::uint32_t dataSize = 0;
        ASSERT_EQ(sqlite3BtreeDataSize(cur.get(), &dataSize), SQLITE_OK);
        EXPECT_EQ(dataSize, ("v" + std::to_string(k)).size());
    }
}

// Inserts 10 000 random keys and checks both walking directions against
// std::string's order; then probes random keys with Moveto.
void checkRandomKeys(int flags) {
    std::mt19937_64 rng(20240601u + static_cast<unsigned>(flags));
    std::map<std::string, std::string> model;
    TestEngine engine;
    std::uint32_t root = engine.createTable(flags);
    ASSERT_NE(root, 0u);
    TestCursor cur(engine.get(), root, 1);
    const bool keyOnly = (flags & BTREE_ZERODATA) != 0;
    for (int i = 0; i < 10000; ++i) {
        std::string key = randomKey(rng);
        std::string data = keyOnly ? std::string() : std::to_string(i) + key;
        ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK);
        model[key] = data;
    }
    std::set<std::string> keys;
    for (const auto& kv : model)
        keys.insert(kv.first);

    // Forward walk.
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    std::size_t n = 0;
    for (auto it = model.begin(); it != model.end(); ++it, ++n) {
        ASSERT_EQ(res, 0) << "forward position " << n;
        ASSERT_EQ(currentKey(cur.get()), it->first) << "forward position " << n;
        ASSERT_EQ(currentData(cur.get()), it->second) << "forward position " << n;
        ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    }
    EXPECT_EQ(res, 1) << "more entries than distinct keys";

    // Backward walk.
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    n = 0;
    for (auto it = keys.rbegin(); it != keys.rend(); ++it, ++n) {
        ASSERT_EQ(res, 0) << "backward position " << n;
        ASSERT_EQ(currentKey(cur.get()), *it) << "backward position " << n;
        ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    }
    EXPECT_EQ(res, 1);

    // Moveto lands on the key, else on the smallest larger key, else on
    // the largest key.
    for (int i = 0; i < 3000; ++i) {
        std::string probe =
            (i % 3 == 0)
                ? *std::next(keys.begin(), static_cast<std::ptrdiff_t>(rng() % keys.size()))
                : randomKey(rng);
        int cmp = seekBytes(cur.get(), probe);
        auto lb = keys.lower_bound(probe);
        if (lb != keys.end() && *lb == probe) {
            ASSERT_EQ(cmp, 0);
            ASSERT_EQ(currentKey(cur.get()), probe);
        } else if (lb != keys.end()) {
            ASSERT_GT(cmp, 0);
            ASSERT_EQ(currentKey(cur.get()), *lb);
        } else {
            ASSERT_LT(cmp, 0);
            ASSERT_EQ(currentKey(cur.get()), *keys.rbegin());
        }
        ASSERT_EQ(sqlite3BtreeEof(cur.get()), 0);
    }
}

TEST(EngineKeyOrder, RandomKeysFollowStringOrderOnByteTable) {
    checkRandomKeys(kByteTable);
}

TEST(EngineKeyOrder, RandomKeysFollowStringOrderOnKeyOnlyTable) {
    checkRandomKeys(kKeyOnlyTable);
}

TEST(EngineKeyOrder, KeysWithZeroAndFfBytesRoundTrip) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    const std::vector<std::string> keys = {
        bytes("\x00"), bytes("\x00\xff\x00"), bytes("\xff"),          bytes("a\x00b"),
        bytes("a"),    std::string(64, '\0'), std::string(64, '\xff')};
    for (const auto& k : keys)
        ASSERT_EQ(insertBytes(cur.get(), k, k + k), SQLITE_OK);
    for (const auto& k : keys) {
        ASSERT_EQ(seekBytes(cur.get(), k), 0);
        std::int64_t size = -1;
        ASSERT_EQ(sqlite3BtreeKeySize(cur.get(), &size), SQLITE_OK);
        EXPECT_EQ(size, static_cast<std::int64_t>(k.size()));
        EXPECT_EQ(currentKey(cur.get()), k);
        EXPECT_EQ(currentData(cur.get()), k + k);
    }
    EXPECT_EQ(walkBytes(cur.get()).size(), keys.size());
}

// ---------------------------------------------------------------------------
// Rule 2: Moveto.

class EngineMovetoBytes : public ::testing::Test {
  protected:
    void SetUp() override {
        root = engine.createTable(kByteTable);
        ASSERT_NE(root, 0u);
        cur = std::make_unique<TestCursor>(engine.get(), root, 1);
        ASSERT_EQ(cur->rc, SQLITE_OK);
        for (const char* k : {"b", "d", "dd", "f"})
            ASSERT_EQ(insertBytes(cur->get(), k, std::string("data-") + k), SQLITE_OK);
    }
    TestEngine engine;
    std::uint32_t root = 0;
    std::unique_ptr<TestCursor> cur;
};

TEST_F(EngineMovetoBytes, EqualKeyGivesZeroAndStandsOnIt) {
    for (const char* k : {"b", "d", "dd", "f"}) {
        EXPECT_EQ(seekBytes(cur->get(), k), 0) << k;
        EXPECT_EQ(currentKey(cur->get()), k);
        EXPECT_EQ(currentData(cur->get()), std::string("data-") + k);
    }
}

TEST_F(EngineMovetoBytes, BetweenKeysLandsOnLargerNeighbourWithPositiveResult) {
    EXPECT_GT(seekBytes(cur->get(), "c"), 0);
    EXPECT_EQ(currentKey(cur->get()), "d");
    // A prefix of a key sorts before it.
    EXPECT_GT(seekBytes(cur->get(), "d" + bytes("\x00")), 0);
    EXPECT_EQ(currentKey(cur->get()), "dd");
    EXPECT_GT(seekBytes(cur->get(), "e"), 0);
    EXPECT_EQ(currentKey(cur->get()), "f");
    EXPECT_GT(seekBytes(cur->get(), "de"), 0);
    EXPECT_EQ(currentKey(cur->get()), "f");
}

TEST_F(EngineMovetoBytes, BelowEveryKeyLandsOnFirstWithPositiveResult) {
    EXPECT_GT(seekBytes(cur->get(), ""), 0);
    EXPECT_EQ(currentKey(cur->get()), "b");
    EXPECT_GT(seekBytes(cur->get(), "a\xff\xff"), 0);
    EXPECT_EQ(currentKey(cur->get()), "b");
}

TEST_F(EngineMovetoBytes, AboveEveryKeyLandsOnLastWithNegativeResult) {
    EXPECT_LT(seekBytes(cur->get(), "f" + bytes("\x00")), 0);
    EXPECT_EQ(currentKey(cur->get()), "f");
    EXPECT_EQ(sqlite3BtreeEof(cur->get()), 0);
    EXPECT_LT(seekBytes(cur->get(), "\xff"), 0);
    EXPECT_EQ(currentKey(cur->get()), "f");
    // From there the walk goes on backwards, and forwards ends.
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreePrevious(cur->get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur->get()), "dd");
    EXPECT_LT(seekBytes(cur->get(), "g"), 0);
    ASSERT_EQ(sqlite3BtreeNext(cur->get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 1);
}

TEST_F(EngineMovetoBytes, WalkContinuesFromTheLandingEntry) {
    EXPECT_GT(seekBytes(cur->get(), "c"), 0);
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeNext(cur->get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur->get()), "dd");
    EXPECT_GT(seekBytes(cur->get(), "c"), 0);
    ASSERT_EQ(sqlite3BtreePrevious(cur->get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur->get()), "b");
}

TEST_F(EngineMovetoBytes, NullKeyRefusedWithCorruptAndCursorStays) {
    ASSERT_EQ(seekBytes(cur->get(), "dd"), 0);
    int res = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeMoveto(cur->get(), nullptr, 0, &res), SQLITE_CORRUPT);
    EXPECT_EQ(sqlite3BtreeMoveto(cur->get(), nullptr, 2, &res), SQLITE_CORRUPT);
    EXPECT_EQ(sqlite3BtreeEof(cur->get()), 0);
    EXPECT_EQ(currentKey(cur->get()), "dd");
}

// Keys far longer than a page share long prefixes and differ only near their ends, or are
// prefixes of one another: the search reads from the overflow pages as much of each key as the
// comparison needs, and every search lands where a std::map's lower_bound says, on the smallest
// key not less than the one sought, with the larger neighbour's result (positive) or, past the
// last key, on the last with a negative one. Inserts searched the same way replace equal keys.
TEST(EngineMoveto, LongKeysSharingLongPrefixesOrderByEveryByte) {
    for (int flags : {kByteTable, kKeyOnlyTable}) {
        TestEngine engine;
        const std::uint32_t root = engine.createTable(flags);
        ASSERT_NE(root, 0u);
        TestCursor cur(engine.get(), root, 1);
        std::map<std::string, std::string> model;
        std::mt19937 rng(11);
        const std::string common(3000, 'p');
        auto someKey = [&] {
            std::string k = common.substr(0, rng() % 2 == 0 ? 3000 : 1500 + rng() % 1500);
            const std::size_t tail = rng() % 4;
            for (std::size_t i = 0; i < tail; ++i)
                k.push_back("\x00p\xff"[rng() % 3]);
            return k;
        };
        for (int i = 0; i < 400; ++i) {
            const std::string k = someKey();
            const std::string d = flags == kByteTable ? std::to_string(i) : std::string();
            ASSERT_EQ(insertBytes(cur.get(), k, d), SQLITE_OK);
            model[k] = d;
        }
        ASSERT_EQ(walkBytes(cur.get()),
                  (std::vector<std::pair<std::string, std::string>>(model.begin(), model.end())));
        for (int i = 0; i < 600; ++i) {
            const std::string k = someKey();
            const int cmp = seekBytes(cur.get(), k);
            const auto at = model.lower_bound(k);
            if (at == model.end()) {
                EXPECT_LT(cmp, 0) << k.size();
                EXPECT_EQ(currentKey(cur.get()), model.rbegin()->first);
            } else {
                if (at->first == k) {
                    EXPECT_EQ(cmp, 0) << k.size();
                } else {
                    EXPECT_GT(cmp, 0) << k.size();
                }
                EXPECT_EQ(currentKey(cur.get()), at->first) << k.size();
                EXPECT_EQ(currentData(cur.get()), at->second);
            }
        }
        EXPECT_EQ(integrityProblems(engine.get()), "");
    }
}

TEST(EngineMoveto, NullKeyOnKeyOnlyTableRefusedWithCorrupt) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kKeyOnlyTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(cur.get(), "k"), SQLITE_OK);
    int res = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeMoveto(cur.get(), nullptr, 1, &res), SQLITE_CORRUPT);
    // An empty table refuses it the same way.
    ASSERT_EQ(cur.close(), SQLITE_OK);
    std::uint32_t empty = engine.createTable(kByteTable);
    ASSERT_NE(empty, 0u);
    TestCursor emptyCur(engine.get(), empty, 0);
    EXPECT_EQ(sqlite3BtreeMoveto(emptyCur.get(), nullptr, 0, &res), SQLITE_CORRUPT);
}

TEST(EngineMoveto, EmptyTableGivesNegativeAndNoEntryThenNextFlagsOne) {
    for (int flags : {kByteTable, kIntTable, kKeyOnlyTable}) {
        TestEngine engine;
        std::uint32_t root = engine.createTable(flags);
        ASSERT_NE(root, 0u);
        TestCursor cur(engine.get(), root, 0);
        int cmp = (flags & BTREE_INTKEY) ? seekInt(cur.get(), 5) : seekBytes(cur.get(), "k");
        EXPECT_LT(cmp, 0) << "flags " << flags;
        EXPECT_NE(cmp, -1000) << "Moveto failed, flags " << flags;
        EXPECT_NE(sqlite3BtreeEof(cur.get()), 0);
        int res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
        EXPECT_EQ(res, 1);
        res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
        EXPECT_EQ(res, 1);
    }
}

TEST(EngineMoveto, IntegerKeysLandOnNeighbours) {
    const std::int64_t kMin = std::numeric_limits<std::int64_t>::min();
    const std::int64_t kMax = std::numeric_limits<std::int64_t>::max();
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    TestCursor cur(engine.get(), root, 1);
    for (std::int64_t k : {kMin, std::int64_t{-1}, std::int64_t{0}, std::int64_t{1}})
        ASSERT_EQ(insertInt(cur.get(), k), SQLITE_OK);
    // Above every key: negative, on the largest.
    EXPECT_LT(seekInt(cur.get(), kMax), 0);
    EXPECT_EQ(currentIntKey(cur.get()), 1);
    EXPECT_LT(seekInt(cur.get(), 2), 0);
    EXPECT_EQ(currentIntKey(cur.get()), 1);
    // Between: positive, on the larger neighbour.
    EXPECT_GT(seekInt(cur.get(), -2), 0);
    EXPECT_EQ(currentIntKey(cur.get()), -1);
    EXPECT_GT(seekInt(cur.get(), kMin + 1), 0);
    EXPECT_EQ(currentIntKey(cur.get()), -1);
    // Equal.
    EXPECT_EQ(seekInt(cur.get(), kMin), 0);
    EXPECT_EQ(currentIntKey(cur.get()), kMin);
    ASSERT_EQ(insertInt(cur.get(), kMax), SQLITE_OK);
    EXPECT_EQ(seekInt(cur.get(), kMax), 0);
    EXPECT_EQ(currentIntKey(cur.get()), kMax);
    EXPECT_GT(seekInt(cur.get(), 2), 0);
    EXPECT_EQ(currentIntKey(cur.get()), kMax);

    // Below every key: positive, on the smallest.
    ASSERT_EQ(cur.close(), SQLITE_OK);
    std::uint32_t root2 = engine.createTable(kIntTable);
    ASSERT_NE(root2, 0u);
    TestCursor cur2(engine.get(), root2, 1);
    for (std::int64_t k : {std::int64_t{0}, kMax})
        ASSERT_EQ(insertInt(cur2.get(), k), SQLITE_OK);
    EXPECT_GT(seekInt(cur2.get(), kMin), 0);
    EXPECT_EQ(currentIntKey(cur2.get()), 0);
    EXPECT_GT(seekInt(cur2.get(), -1), 0);
    EXPECT_EQ(currentIntKey(cur2.get()), 0);
}

// ---------------------------------------------------------------------------
// Rule 3: the flags of First, Last, Next and Previous.

TEST(EngineFirstLast, EmptyTableSetsFlagOne) {
    for (int flags : {kByteTable, kIntTable, kKeyOnlyTable}) {
        TestEngine engine;
        std::uint32_t root = engine.createTable(flags);
        TestCursor cur(engine.get(), root, 0);
        int res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
        EXPECT_EQ(res, 1) << "flags " << flags;
        EXPECT_NE(sqlite3BtreeEof(cur.get()), 0);
        res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
        EXPECT_EQ(res, 1) << "flags " << flags;
        EXPECT_NE(sqlite3BtreeEof(cur.get()), 0);
    }
}

TEST(EngineFirstLast, NonEmptyTableSetsFlagZeroOnTheEndEntries) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(cur.get(), "only", "x"), SQLITE_OK);
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "only");
    res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "only");
    for (const char* k : {"a", "z", "m"})
        ASSERT_EQ(insertBytes(cur.get(), k, "x"), SQLITE_OK);
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "a");
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "z");
}

class EngineNextPrevious : public ::testing::Test {
  protected:
    void SetUp() override {
        root = engine.createTable(kByteTable);
        ASSERT_NE(root, 0u);
        TestCursor writer(engine.get(), root, 1);
        for (const char* k : {"a", "b", "c"})
            ASSERT_EQ(insertBytes(writer.get(), k), SQLITE_OK);
    }
    TestEngine engine;
    std::uint32_t root = 0;
};

namespace {

// The flag a move leaves (kFlagSentinel when it wrote none), the move itself succeeding.
template <typename Move>
int flagOf(Move move, BtCursor* cur) {
    int res = kFlagSentinel;
    EXPECT_EQ(move(cur, &res), SQLITE_OK);
    return res;
}

// Once on no entry, both directions report no entry and the cursor stays on none.
void expectStepsFindNothing(BtCursor* cur) {
    EXPECT_EQ(flagOf(sqlite3BtreeNext, cur), 1);
    EXPECT_EQ(flagOf(sqlite3BtreePrevious, cur), 1);
    EXPECT_NE(sqlite3BtreeEof(cur), 0);
}

}  // namespace

TEST_F(EngineNextPrevious, NextPastLastEntrySetsFlagOneAndLeavesNoEntry) {
    TestCursor cur(engine.get(), root, 0);
    ASSERT_EQ(flagOf(sqlite3BtreeLast, cur.get()), 0);
    EXPECT_EQ(flagOf(sqlite3BtreeNext, cur.get()), 1);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0);
    expectStepsFindNothing(cur.get());
}

TEST_F(EngineNextPrevious, PreviousBeforeFirstEntrySetsFlagOneAndLeavesNoEntry) {
    TestCursor cur(engine.get(), root, 0);
    ASSERT_EQ(flagOf(sqlite3BtreeFirst, cur.get()), 0);
    EXPECT_EQ(flagOf(sqlite3BtreePrevious, cur.get()), 1);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0);
    expectStepsFindNothing(cur.get());
}

TEST_F(EngineNextPrevious, NeverPositionedCursorSetsFlagOne) {
    TestCursor cur(engine.get(), root, 0);
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 1);
    TestCursor cur2(engine.get(), root, 0);
    res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreePrevious(cur2.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 1);
    EXPECT_NE(sqlite3BtreeEof(cur2.get()), 0);
}

TEST_F(EngineNextPrevious, StepsVisitEveryEntryInBothDirections) {
    TestCursor cur(engine.get(), root, 0);
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(cur.get()), "a");
    ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "b");
    ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(cur.get()), "c");
    ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 0);
    EXPECT_EQ(currentKey(cur.get()), "b");
    ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(cur.get()), "a");
    ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(cur.get()), "b");
}

// ---------------------------------------------------------------------------
// Rule 4: Eof.

TEST(EngineEof, NonzeroInEveryStateButOnAnEntry) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    int res = kFlagSentinel;
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "never positioned";
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "First on an empty table";
    EXPECT_LT(seekBytes(cur.get(), "x"), 0);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "Moveto on an empty table";
    ASSERT_EQ(insertBytes(cur.get(), "k", "v"), SQLITE_OK);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "after an insert";
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0) << "on the first entry";
    ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "past the last entry";
    ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0) << "on the last entry";
    ASSERT_EQ(sqlite3BtreePrevious(cur.get(), &res), SQLITE_OK);
    EXPECT_NE(sqlite3BtreeEof(cur.get()), 0) << "before the first entry";
    EXPECT_GT(seekBytes(cur.get(), "a"), 0);
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0) << "Moveto landing on an entry";
    EXPECT_EQ(seekBytes(cur.get(), "k"), 0);
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0) << "Moveto on an equal entry";
}

// ---------------------------------------------------------------------------
// Rule 5: key and data reads.

TEST(EngineRead, KeyOnIntegerTableRefusedWithCorruptBufferUntouched) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertInt(cur.get(), 42, "data"), SQLITE_OK);
    ASSERT_EQ(seekInt(cur.get(), 42), 0);
    for (std::uint32_t amt : {1u, 4u, 8u}) {
        auto r = readKey(cur.get(), 0, amt, 16);
        EXPECT_EQ(r.first, SQLITE_CORRUPT) << "amount " << amt;
        EXPECT_EQ(r.second, std::string(16, kFill));
    }
    // The entry is still readable the integer way.
    EXPECT_EQ(currentIntKey(cur.get()), 42);
    EXPECT_EQ(currentData(cur.get()), "data");
}

// Reads every (offset, amount) pair of a small entry through Key and Data.
TEST(EngineRead, EveryOffsetAndAmountWithinTheEntryAndOneByteMoreRefused) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    const std::string key = bytes("key\x00-sixteen-!!\xff");  // 16 bytes
    ASSERT_EQ(key.size(), 16u);
    const std::string data = patternBytes(40, 3);
    ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), key), 0);
    const std::string whole = key + data;
    const std::size_t bufSize = whole.size() + 8;
    for (std::size_t off = 0; off <= whole.size() + 1; ++off) {
        for (std::size_t amt = 0; off + amt <= whole.size() + 1; ++amt) {
            auto r = readKey(cur.get(), static_cast<std::uint32_t>(off),
                             static_cast<std::uint32_t>(amt), bufSize);
            if (off + amt <= whole.size()) {
                ASSERT_EQ(r.first, SQLITE_OK) << "Key offset " << off << " amount " << amt;
                ASSERT_EQ(r.second, expectedRead(whole, off, amt, bufSize))
                    << "Key offset " << off << " amount " << amt;
            } else {
                ASSERT_EQ(r.first, SQLITE_ERROR) << "Key offset " << off << " amount " << amt;
                ASSERT_EQ(r.second, std::string(bufSize, kFill))
                    << "Key offset " << off << " amount " << amt;
            }
        }
    }
    for (std::size_t off = 0; off <= data.size() + 1; ++off) {
        for (std::size_t amt = 0; off + amt <= data.size() + 1; ++amt) {
            auto r = readData(cur.get(), static_cast<std::uint32_t>(off),
                              static_cast<std::uint32_t>(amt), bufSize);
            if (off + amt <= data.size()) {
                ASSERT_EQ(r.first, SQLITE_OK) << "Data offset " << off << " amount " << amt;
                ASSERT_EQ(r.second, expectedRead(data, off, amt, bufSize))
                    << "Data offset " << off << " amount " << amt;
            } else {
                ASSERT_EQ(r.first, SQLITE_ERROR) << "Data offset " << off << " amount " << amt;
                ASSERT_EQ(r.second, std::string(bufSize, kFill))
                    << "Data offset " << off << " amount " << amt;
            }
        }
    }
}

TEST(EngineRead, OffsetPlusAmountWrappingAroundIsRefused) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(cur.get(), "key", "data"), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), "key"), 0);
    const std::uint32_t kMax = std::numeric_limits<std::uint32_t>::max();
    for (auto [off, amt] : std::vector<std::pair<std::uint32_t, std::uint32_t>>{
             {kMax, 2}, {kMax, 1}, {2, kMax}, {kMax, kMax}, {0x80000000u, 0x80000001u}}) {
        auto k = readKey(cur.get(), off, amt, 16);
        EXPECT_EQ(k.first, SQLITE_ERROR) << "Key offset " << off << " amount " << amt;
        EXPECT_EQ(k.second, std::string(16, kFill));
        auto d = readData(cur.get(), off, amt, 16);
        EXPECT_EQ(d.first, SQLITE_ERROR) << "Data offset " << off << " amount " << amt;
        EXPECT_EQ(d.second, std::string(16, kFill));
    }
}

// Entries with keys of 0, 1, 15, 16, 1 000 and 100 000 bytes and data of 0
// bytes, a few bytes and 1 MiB.
TEST(EngineRead, KeyAndDataLengthsRoundTrip) {
    const std::vector<std::size_t> keyLengths = {0, 1, 15, 16, 1000, 100000};
    const std::vector<std::size_t> dataLengths = {0, 7, std::size_t{1} << 20};
    TestEngine engine;
    for (std::size_t dataLen : dataLengths) {
        std::uint32_t root = engine.createTable(kByteTable);
        ASSERT_NE(root, 0u);
        TestCursor cur(engine.get(), root, 1);
        ASSERT_EQ(cur.rc, SQLITE_OK);
        for (std::size_t keyLen : keyLengths) {
            // Key bytes start with the length so that keys stay distinct.
            std::string key = patternBytes(keyLen, static_cast<unsigned>(keyLen));
            if (keyLen > 0)
                key[0] = static_cast<char>(keyLen % 251);
            std::string data = patternBytes(dataLen, static_cast<unsigned>(keyLen + 1));
            ASSERT_EQ(insertBytes(cur.get(), key, data), SQLITE_OK)
                << "key " << keyLen << " data " << dataLen;
        }
        for (std::size_t keyLen : keyLengths) {
            SCOPED_TRACE("key " + std::to_string(keyLen) + " data " + std::to_string(dataLen));
            std::string key = patternBytes(keyLen, static_cast<unsigned>(keyLen));
            if (keyLen > 0)
                key[0] = static_cast<char>(keyLen % 251);
            std::string data = patternBytes(dataLen, static_cast<unsigned>(keyLen + 1));
            const std::string whole = key + data;
            ASSERT_EQ(seekBytes(cur.get(), key), 0);

            std::int64_t keySize = -1;
            ASSERT_EQ(sqlite3BtreeKeySize(cur.get(), &keySize), SQLITE_OK);
            EXPECT_EQ(keySize, static_cast<std::int64_t>(keyLen));
            std::uint32_t dataSize = 0xffffffffu;
            ASSERT_EQ(sqlite3BtreeDataSize(cur.get(), &dataSize), SQLITE_OK);
            EXPECT_EQ(dataSize, dataLen);
            EXPECT_TRUE(currentKey(cur.get()) == key);
            EXPECT_TRUE(currentData(cur.get()) == data);

            const std::size_t bufSize = whole.size() + 8;
            std::vector<std::size_t> lengths;
            if (whole.size() <= 2100) {
                for (std::size_t n = 0; n <= whole.size(); ++n)
                    lengths.push_back(n);
            } else {
                lengths = {0, 1, whole.size() - 1, whole.size()};
                if (keyLen > 0)
                    lengths.push_back(keyLen - 1);
                lengths.push_back(keyLen);
                if (keyLen < whole.size())
                    lengths.push_back(keyLen + 1);
            }
            for (std::size_t n : lengths) {
                auto r = readKey(cur.get(), 0, static_cast<std::uint32_t>(n), bufSize);
                ASSERT_EQ(r.first, SQLITE_OK) << "Key amount " << n;
                ASSERT_TRUE(r.second == expectedRead(whole, 0, n, bufSize)) << "Key amount " << n;
            }
            auto over =
                readKey(cur.get(), 0, static_cast<std::uint32_t>(whole.size() + 1), bufSize);
            EXPECT_EQ(over.first, SQLITE_ERROR);
            EXPECT_TRUE(over.second == std::string(bufSize, kFill)) << "refused Key read wrote";
            // The data part reached through Key from the key's end.
            auto tail = readKey(cur.get(), static_cast<std::uint32_t>(keyLen),
                                static_cast<std::uint32_t>(dataLen), bufSize);
            ASSERT_EQ(tail.first, SQLITE_OK);
            EXPECT_TRUE(tail.second == expectedRead(whole, keyLen, dataLen, bufSize));

            const std::size_t dataBuf = dataLen + 8;
            std::vector<std::size_t> dataReads;
            if (dataLen <= 2100) {
                for (std::size_t n = 0; n <= dataLen; ++n)
                    dataReads.push_back(n);
            } else {
                dataReads = {0, 1, dataLen / 2, dataLen - 1, dataLen};
            }
            for (std::size_t n : dataReads) {
                auto r = readData(cur.get(), 0, static_cast<std::uint32_t>(n), dataBuf);
                ASSERT_EQ(r.first, SQLITE_OK) << "Data amount " << n;
                ASSERT_TRUE(r.second == expectedRead(data, 0, n, dataBuf)) << "Data amount " << n;
            }
            auto dataOver =
                readData(cur.get(), 0, static_cast<std::uint32_t>(dataLen + 1), dataBuf);
            EXPECT_EQ(dataOver.first, SQLITE_ERROR);
            EXPECT_TRUE(dataOver.second == std::string(dataBuf, kFill))
                << "refused Data read wrote";
        }
        // All entries present, in order of their keys.
        EXPECT_EQ(walkBytes(cur.get()).size(), keyLengths.size());
    }
}

TEST(EngineRead, KeyOnlyTableHasNoDataBytes) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kKeyOnlyTable);
    TestCursor cur(engine.get(), root, 1);
    // Data given to a key-only table is not stored.
    ASSERT_EQ(insertBytes(cur.get(), "keyonly", "ignored data"), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), "keyonly"), 0);
    std::uint32_t dataSize = 77;
    ASSERT_EQ(sqlite3BtreeDataSize(cur.get(), &dataSize), SQLITE_OK);
    EXPECT_EQ(dataSize, 0u);
    EXPECT_EQ(currentKey(cur.get()), "keyonly");
    for (std::uint32_t n = 0; n <= 7; ++n) {
        auto r = readKey(cur.get(), 0, n, 16);
        ASSERT_EQ(r.first, SQLITE_OK) << n;
        EXPECT_EQ(r.second, expectedRead("keyonly", 0, n, 16));
    }
    auto over = readKey(cur.get(), 0, 8, 16);
    EXPECT_EQ(over.first, SQLITE_ERROR);
    EXPECT_EQ(over.second, std::string(16, kFill));
    auto data = readData(cur.get(), 0, 1, 16);
    EXPECT_EQ(data.first, SQLITE_ERROR);
    EXPECT_EQ(data.second, std::string(16, kFill));
    auto empty = readData(cur.get(), 0, 0, 16);
    EXPECT_EQ(empty.first, SQLITE_OK);
}

TEST(EngineRead, IntegerTableDataReadsOfEveryLength) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    TestCursor cur(engine.get(), root, 1);
    const std::string data = patternBytes(300, 9);
    ASSERT_EQ(insertInt(cur.get(), -7, data), SQLITE_OK);
    ASSERT_EQ(seekInt(cur.get(), -7), 0);
    for (std::size_t n = 0; n <= data.size(); ++n) {
        auto r = readData(cur.get(), 0, static_cast<std::uint32_t>(n), 310);
        ASSERT_EQ(r.first, SQLITE_OK) << n;
        ASSERT_EQ(r.second, expectedRead(data, 0, n, 310)) << n;
    }
    auto over = readData(cur.get(), 0, 301, 310);
    EXPECT_EQ(over.first, SQLITE_ERROR);
    EXPECT_EQ(over.second, std::string(310, kFill));
}

TEST(EngineRead, ReadsOnNoEntryAreRefusedAndWriteNothing) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(cur.get(), "k", "v"), SQLITE_OK);
    // After the insert the cursor is on no entry.
    ASSERT_NE(sqlite3BtreeEof(cur.get()), 0);
    auto k = readKey(cur.get(), 0, 1, 8);
    EXPECT_NE(k.first, SQLITE_OK);
    EXPECT_EQ(k.second, std::string(8, kFill));
    auto d = readData(cur.get(), 0, 1, 8);
    EXPECT_NE(d.first, SQLITE_OK);
    EXPECT_EQ(d.second, std::string(8, kFill));
}

// ---------------------------------------------------------------------------
// Rule 6: insert replaces or adds; every cursor on the table ends on no entry.

TEST(EngineInsert, EqualKeyLeavesOneEntryWithTheNewData) {
    TestEngine engine;
    std::uint32_t bytesRoot = engine.createTable(kByteTable);
    std::uint32_t intRoot = engine.createTable(kIntTable);
    std::uint32_t keyRoot = engine.createTable(kKeyOnlyTable);
    TestCursor b(engine.get(), bytesRoot, 1);
    TestCursor i(engine.get(), intRoot, 1);
    TestCursor k(engine.get(), keyRoot, 1);
    ASSERT_EQ(insertBytes(b.get(), "a", "old"), SQLITE_OK);
    ASSERT_EQ(insertBytes(b.get(), "key", "old data"), SQLITE_OK);
    ASSERT_EQ(insertBytes(b.get(), "key", "new"), SQLITE_OK);
    ASSERT_EQ(insertInt(i.get(), 5, "old data"), SQLITE_OK);
    ASSERT_EQ(insertInt(i.get(), 5, "n"), SQLITE_OK);
    ASSERT_EQ(insertBytes(k.get(), "key"), SQLITE_OK);
    ASSERT_EQ(insertBytes(k.get(), "key"), SQLITE_OK);

    auto bAll = walkBytes(b.get());
    ASSERT_EQ(bAll.size(), 2u);
    EXPECT_EQ(bAll[1], std::make_pair(std::string("key"), std::string("new")));
    auto iAll = walkInts(i.get());
    ASSERT_EQ(iAll.size(), 1u);
    EXPECT_EQ(iAll[0], std::make_pair(std::int64_t{5}, std::string("n")));
    auto kAll = walkBytes(k.get());
    ASSERT_EQ(kAll.size(), 1u);
    EXPECT_EQ(kAll[0].first, "key");

    // Replacing with empty data, then with larger data again.
    ASSERT_EQ(sqlite3BtreeInsert(b.get(), "key", 3, nullptr, 0), SQLITE_OK);
    ASSERT_EQ(seekBytes(b.get(), "key"), 0);
    EXPECT_EQ(currentData(b.get()), "");
    const std::string big = patternBytes(20000, 4);
    ASSERT_EQ(insertBytes(b.get(), "key", big), SQLITE_OK);
    ASSERT_EQ(seekBytes(b.get(), "key"), 0);
    EXPECT_TRUE(currentData(b.get()) == big);
    EXPECT_EQ(walkBytes(b.get()).size(), 2u);
}

TEST(EngineInsert, EmptyKeyIsAnEntryOfItsOwn) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(cur.get(), "", "empty"), SQLITE_OK);
    ASSERT_EQ(insertBytes(cur.get(), bytes("\x00"), "zero"), SQLITE_OK);
    auto all = walkBytes(cur.get());
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0], std::make_pair(std::string(), std::string("empty")));
    EXPECT_EQ(all[1], std::make_pair(bytes("\x00"), std::string("zero")));
    EXPECT_EQ(seekBytes(cur.get(), ""), 0);
    std::int64_t size = -1;
    ASSERT_EQ(sqlite3BtreeKeySize(cur.get(), &size), SQLITE_OK);
    EXPECT_EQ(size, 0);
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0);
}

TEST(EngineInsert, NullDataWithZeroLengthStoresEmptyData) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor cur(engine.get(), root, 1);
    ASSERT_EQ(sqlite3BtreeInsert(cur.get(), "k", 1, nullptr, 0), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), "k"), 0);
    std::uint32_t size = 99;
    ASSERT_EQ(sqlite3BtreeDataSize(cur.get(), &size), SQLITE_OK);
    EXPECT_EQ(size, 0u);
}

TEST(EngineInsert, NegativeDataLengthRefusedAndNothingAdded) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    std::uint32_t intRoot = engine.createTable(kIntTable);
    TestCursor cur(engine.get(), root, 1);
    TestCursor icur(engine.get(), intRoot, 1);
    ASSERT_EQ(insertBytes(cur.get(), "k", "v"), SQLITE_OK);
    ASSERT_EQ(insertInt(icur.get(), 1, "v"), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), "k"), 0);
    EXPECT_EQ(sqlite3BtreeInsert(cur.get(), "n", 1, "xyz", -1), SQLITE_ERROR);
    EXPECT_EQ(sqlite3BtreeInsert(cur.get(), "k", 1, "xyz", -3), SQLITE_ERROR);
    EXPECT_EQ(sqlite3BtreeInsert(icur.get(), nullptr, 2, "xyz", -1), SQLITE_ERROR);
    // The refusal left the cursor where it was.
    EXPECT_EQ(sqlite3BtreeEof(cur.get()), 0);
    EXPECT_EQ(currentKey(cur.get()), "k");
    auto all = walkBytes(cur.get());
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0], std::make_pair(std::string("k"), std::string("v")));
    auto iAll = walkInts(icur.get());
    ASSERT_EQ(iAll.size(), 1u);
    EXPECT_EQ(iAll[0], std::make_pair(std::int64_t{1}, std::string("v")));
}

TEST(EngineInsert, EveryCursorOnTheTableIsOnNoEntryAfterwards) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor a(engine.get(), root, 1);
    TestCursor b(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(a.get(), "k1", "v1"), SQLITE_OK);
    ASSERT_EQ(insertBytes(a.get(), "k3", "v3"), SQLITE_OK);
    ASSERT_EQ(seekBytes(a.get(), "k1"), 0);
    ASSERT_EQ(seekBytes(b.get(), "k3"), 0);
    ASSERT_EQ(insertBytes(a.get(), "k2", "v2"), SQLITE_OK);
    for (BtCursor* c : {a.get(), b.get()}) {
        EXPECT_NE(sqlite3BtreeEof(c), 0);
        std::int64_t keySize = 5;
        ASSERT_EQ(sqlite3BtreeKeySize(c, &keySize), SQLITE_OK);
        EXPECT_EQ(keySize, 0);
        std::uint32_t dataSize = 5;
        ASSERT_EQ(sqlite3BtreeDataSize(c, &dataSize), SQLITE_OK);
        EXPECT_EQ(dataSize, 0u);
        int res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreeNext(c, &res), SQLITE_OK);
        EXPECT_EQ(res, 1);
    }
    // Replacing an entry does the same.
    ASSERT_EQ(seekBytes(a.get(), "k1"), 0);
    ASSERT_EQ(seekBytes(b.get(), "k2"), 0);
    ASSERT_EQ(insertBytes(b.get(), "k2", "again"), SQLITE_OK);
    EXPECT_NE(sqlite3BtreeEof(a.get()), 0);
    EXPECT_NE(sqlite3BtreeEof(b.get()), 0);
    // And the cursors move normally again.
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(b.get(), &res), SQLITE_OK);
    ASSERT_EQ(res, 0);
    EXPECT_EQ(currentKey(b.get()), "k1");
    ASSERT_EQ(sqlite3BtreeNext(b.get(), &res), SQLITE_OK);
    EXPECT_EQ(currentKey(b.get()), "k2");
    EXPECT_EQ(currentData(b.get()), "again");
}

TEST(EngineInsert, CursorOnAnotherTableKeepsItsEntry) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    std::uint32_t other = engine.createTable(kByteTable);
    TestCursor w(engine.get(), root, 1);
    TestCursor o(engine.get(), other, 1);
    ASSERT_EQ(insertBytes(o.get(), "x", "y"), SQLITE_OK);
    ASSERT_EQ(seekBytes(o.get(), "x"), 0);
    ASSERT_EQ(insertBytes(w.get(), "k", "v"), SQLITE_OK);
    EXPECT_EQ(sqlite3BtreeEof(o.get()), 0);
    EXPECT_EQ(currentKey(o.get()), "x");
    EXPECT_EQ(currentData(o.get()), "y");
}

// ---------------------------------------------------------------------------
// Rule 7: inserting through a read cursor.

TEST(EngineInsert, ReadCursorRefusedWithPermAndNothingAdded) {
    for (int flags : {kByteTable, kIntTable, kKeyOnlyTable}) {
        SCOPED_TRACE("flags " + std::to_string(flags));
        TestEngine engine;
        std::uint32_t root = engine.createTable(flags);
        const bool intKey = (flags & BTREE_INTKEY) != 0;
        {
            TestCursor w(engine.get(), root, 1);
            ASSERT_EQ(intKey ? insertInt(w.get(), 1, "v") : insertBytes(w.get(), "a", "v"),
                      SQLITE_OK);
        }
        TestCursor r(engine.get(), root, 0);
        ASSERT_EQ(r.rc, SQLITE_OK);
        ASSERT_EQ(intKey ? seekInt(r.get(), 1) : seekBytes(r.get(), "a"), 0);
        EXPECT_EQ(intKey ? insertInt(r.get(), 2, "w") : insertBytes(r.get(), "b", "w"),
                  SQLITE_PERM);
        EXPECT_EQ(intKey ? insertInt(r.get(), 1, "w") : insertBytes(r.get(), "a", "w"),
                  SQLITE_PERM);
        // The read cursor is still on its entry, and the table is unchanged.
        EXPECT_EQ(sqlite3BtreeEof(r.get()), 0);
        if (intKey) {
            EXPECT_EQ(currentIntKey(r.get()), 1);
            auto all = walkInts(r.get());
            ASSERT_EQ(all.size(), 1u);
            EXPECT_EQ(all[0], std::make_pair(std::int64_t{1}, std::string("v")));
        } else {
            EXPECT_EQ(currentKey(r.get()), "a");
            auto all = walkBytes(r.get());
            ASSERT_EQ(all.size(), 1u);
            EXPECT_EQ(all[0].first, "a");
            if (flags == kByteTable) {
                EXPECT_EQ(all[0].second, "v");
            }
        }
    }
}

// ---------------------------------------------------------------------------
// Rule 8: read cursors lock their table against writers.

TEST(EngineLocks, WritingCursorRefusedWhileReadCursorOpen) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    {
        TestCursor w(engine.get(), root, 1);
        ASSERT_EQ(insertBytes(w.get(), "a", "v"), SQLITE_OK);
    }
    auto r = std::make_unique<TestCursor>(engine.get(), root, 0);
    ASSERT_EQ(r->rc, SQLITE_OK);
    ASSERT_EQ(seekBytes(r->get(), "a"), 0);
    int marker = 0;
    BtCursor* w = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root, 1, nullptr, nullptr, &w), SQLITE_LOCKED);
    EXPECT_EQ(w, nullptr);
    // The read cursor is undisturbed; a second read cursor is allowed.
    EXPECT_EQ(currentKey(r->get()), "a");
    TestCursor r2(engine.get(), root, 0);
    EXPECT_EQ(r2.rc, SQLITE_OK);
    EXPECT_NE(r2.get(), nullptr);
    // Still refused while any read cursor remains.
    r.reset();
    w = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root, 1, nullptr, nullptr, &w), SQLITE_LOCKED);
    EXPECT_EQ(w, nullptr);
    // Once the last read cursor is closed, writing cursors open again.
    ASSERT_EQ(r2.close(), SQLITE_OK);
    TestCursor w2(engine.get(), root, 1);
    EXPECT_EQ(w2.rc, SQLITE_OK);
    ASSERT_NE(w2.get(), nullptr);
    EXPECT_EQ(insertBytes(w2.get(), "b", "v"), SQLITE_OK);
    EXPECT_EQ(walkBytes(w2.get()).size(), 2u);
}

TEST(EngineLocks, InsertRefusedWhileReadCursorOpenAndStateUnchanged) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    TestCursor w(engine.get(), root, 1);
    ASSERT_EQ(insertBytes(w.get(), "a", "v"), SQLITE_OK);
    ASSERT_EQ(insertBytes(w.get(), "c", "v"), SQLITE_OK);
    ASSERT_EQ(seekBytes(w.get(), "c"), 0);
    auto r = std::make_unique<TestCursor>(engine.get(), root, 0);
    ASSERT_EQ(r->rc, SQLITE_OK);
    ASSERT_EQ(seekBytes(r->get(), "a"), 0);
    EXPECT_EQ(insertBytes(w.get(), "b", "new"), SQLITE_LOCKED);
    EXPECT_EQ(insertBytes(w.get(), "a", "new"), SQLITE_LOCKED);
    // Both cursors stay on their entries.
    EXPECT_EQ(sqlite3BtreeEof(w.get()), 0);
    EXPECT_EQ(currentKey(w.get()), "c");
    EXPECT_EQ(sqlite3BtreeEof(r->get()), 0);
    EXPECT_EQ(currentKey(r->get()), "a");
    auto all = walkBytes(r->get());
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0], std::make_pair(std::string("a"), std::string("v")));
    EXPECT_EQ(all[1], std::make_pair(std::string("c"), std::string("v")));
    r.reset();
    EXPECT_EQ(insertBytes(w.get(), "b", "new"), SQLITE_OK);
    EXPECT_EQ(walkBytes(w.get()).size(), 3u);
}

TEST(EngineLocks, ReadCursorOnAnotherTableDoesNotLock) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    std::uint32_t other = engine.createTable(kByteTable);
    TestCursor r(engine.get(), other, 0);
    ASSERT_EQ(r.rc, SQLITE_OK);
    TestCursor w(engine.get(), root, 1);
    EXPECT_EQ(w.rc, SQLITE_OK);
    ASSERT_NE(w.get(), nullptr);
    EXPECT_EQ(insertBytes(w.get(), "k", "v"), SQLITE_OK);
    EXPECT_EQ(walkBytes(w.get()).size(), 1u);
}

TEST(EngineLocks, SeveralWritingCursorsOnOneTable) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kIntTable);
    TestCursor a(engine.get(), root, 1);
    TestCursor b(engine.get(), root, 1);
    ASSERT_EQ(a.rc, SQLITE_OK);
    ASSERT_EQ(b.rc, SQLITE_OK);
    EXPECT_EQ(insertInt(a.get(), 1, "a"), SQLITE_OK);
    EXPECT_EQ(insertInt(b.get(), 2, "b"), SQLITE_OK);
    auto all = walkInts(a.get());
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0], std::make_pair(std::int64_t{1}, std::string("a")));
    EXPECT_EQ(all[1], std::make_pair(std::int64_t{2}, std::string("b")));
}

// ---------------------------------------------------------------------------
// Rule 9: creating and dropping tables.

TEST(EngineTables, CreateRefusedWhileAnyCursorOpen) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    ASSERT_NE(root, 0u);
    for (int wr : {0, 1}) {
        TestCursor cur(engine.get(), root, wr);
        ASSERT_EQ(cur.rc, SQLITE_OK);
        std::uint32_t newRoot = 0;
        for (int flags : {kByteTable, kIntTable, kKeyOnlyTable})
            EXPECT_EQ(sqlite3BtreeCreateTable(engine.get(), &newRoot, flags), SQLITE_LOCKED)
                << "write flag " << wr << " table flags " << flags;
    }
    // With every cursor closed, creation works again.
    std::uint32_t newRoot = 0;
    EXPECT_EQ(sqlite3BtreeCreateTable(engine.get(), &newRoot, kIntTable), SQLITE_OK);
    EXPECT_NE(newRoot, 0u);
    EXPECT_NE(newRoot, root);
}

TEST(EngineTables, DropRefusedWhileAnyCursorOpenAndTableStays) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    std::uint32_t other = engine.createTable(kByteTable);
    {
        TestCursor w(engine.get(), root, 1);
        ASSERT_EQ(insertBytes(w.get(), "k", "v"), SQLITE_OK);
    }
    for (int wr : {0, 1}) {
        // A cursor on another table locks the drop as well.
        TestCursor cur(engine.get(), other, wr);
        ASSERT_EQ(cur.rc, SQLITE_OK);
        int moved = kFlagSentinel;
        EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), root, &moved), SQLITE_LOCKED);
    }
    {
        TestCursor cur(engine.get(), root, 0);
        int moved = kFlagSentinel;
        EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), root, &moved), SQLITE_LOCKED);
        auto all = walkBytes(cur.get());
        ASSERT_EQ(all.size(), 1u);
        EXPECT_EQ(all[0], std::make_pair(std::string("k"), std::string("v")));
    }
    // The table is still there.
    TestCursor again(engine.get(), root, 0);
    ASSERT_EQ(again.rc, SQLITE_OK);
    auto all = walkBytes(again.get());
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0], std::make_pair(std::string("k"), std::string("v")));
}

TEST(EngineTables, DropAfterCursorsClosedRemovesTable) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    std::uint32_t keep = engine.createTable(kIntTable);
    {
        TestCursor w(engine.get(), root, 1);
        ASSERT_EQ(insertBytes(w.get(), "k", "v"), SQLITE_OK);
        TestCursor w2(engine.get(), keep, 1);
        ASSERT_EQ(insertInt(w2.get(), 3, "kept"), SQLITE_OK);
    }
    int moved = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeDropTable(engine.get(), root, &moved), SQLITE_OK);
    EXPECT_EQ(moved, 0);
    int marker = 0;
    BtCursor* cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root, 0, nullptr, nullptr, &cur), SQLITE_ERROR);
    EXPECT_EQ(cur, nullptr);
    cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root, 1, nullptr, nullptr, &cur), SQLITE_ERROR);
    EXPECT_EQ(cur, nullptr);
    // Dropping it a second time names no table.
    EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), root, &moved), SQLITE_ERROR);
    // The other table is untouched.
    TestCursor k(engine.get(), keep, 0);
    auto all = walkInts(k.get());
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0], std::make_pair(std::int64_t{3}, std::string("kept")));
}

TEST(EngineTables, UnknownRootRefusedForDropAndCursor) {
    TestEngine engine;
    std::uint32_t root = engine.createTable(kByteTable);
    ASSERT_NE(root, 0u);
    int moved = kFlagSentinel;
    EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), root + 1000, &moved), SQLITE_ERROR);
    EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), 0, &moved), SQLITE_ERROR);
    int marker = 0;
    BtCursor* cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), root + 1000, 0, nullptr, nullptr, &cur),
              SQLITE_ERROR);
    EXPECT_EQ(cur, nullptr);
    cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), 0, 1, nullptr, nullptr, &cur), SQLITE_ERROR);
    EXPECT_EQ(cur, nullptr);
    // The page of the engine's own catalogue names no table of the store.
    cur = reinterpret_cast<BtCursor*>(&marker);
    EXPECT_EQ(sqlite3BtreeCursor(engine.get(), 1, 0, nullptr, nullptr, &cur), SQLITE_ERROR);
    EXPECT_EQ(cur, nullptr);
    EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), 1, &moved), SQLITE_ERROR);
    // Nothing was left open by the refusals.
    EXPECT_NE(engine.createTable(kByteTable), 0u);
}

TEST(EngineTables, CreateAndDropNeedAWriteTransaction) {
    {
        TestEngine engine(/*beginWrite=*/false);
        ASSERT_NE(engine.get(), nullptr);
        std::uint32_t root = 0xdeadbeefu;
        EXPECT_EQ(sqlite3BtreeCreateTable(engine.get(), &root, kByteTable), SQLITE_ERROR);
        int moved = kFlagSentinel;
        EXPECT_EQ(sqlite3BtreeDropTable(engine.get(), 2, &moved), SQLITE_ERROR);
    }
    {
        TestEngine engine(/*beginWrite=*/false);
        ASSERT_NE(engine.get(), nullptr);
        ASSERT_EQ(sqlite3BtreeBeginTrans(engine.get(), 0), SQLITE_OK);
        std::uint32_t root = 0;
        EXPECT_EQ(sqlite3BtreeCreateTable(engine.get(), &root, kIntTable), SQLITE_ERROR);
    }
    {
        TestEngine engine(/*beginWrite=*/false);
        ASSERT_EQ(sqlite3BtreeBeginTrans(engine.get(), 1), SQLITE_OK);
        EXPECT_NE(engine.createTable(kIntTable), 0u);
    }
}

// ---------------------------------------------------------------------------
// Rule 10: page size.

TEST(EnginePageSize, AcceptsPowersOfTwoFrom512To32768BeforeFirstPage) {
    TestEngine engine(/*beginWrite=*/false);
    ASSERT_NE(engine.get(), nullptr);
    for (int size : {512, 1024, 2048, 4096, 8192, 16384, 32768})
        EXPECT_EQ(sqlite3BtreeSetPageSize(engine.get(), size, -1), SQLITE_OK) << size;
    for (int size : {0, -1, -4096, 1, 256, 511, 513, 1000, 3000, 4095, 4097, 65536, 131072})
        EXPECT_NE(sqlite3BtreeSetPageSize(engine.get(), size, -1), SQLITE_OK) << size;
    // The engine is usable afterwards.
    ASSERT_EQ(sqlite3BtreeSetPageSize(engine.get(), 4096, -1), SQLITE_OK);
    ASSERT_EQ(sqlite3BtreeBeginTrans(engine.get(), 2), SQLITE_OK);
    std::uint32_t root = engine.createTable(kByteTable);
    ASSERT_NE(root, 0u);
    TestCursor cur(engine.get(), root, 1);
    EXPECT_EQ(insertBytes(cur.get(), "k", patternBytes(10000, 1)), SQLITE_OK);
    ASSERT_EQ(seekBytes(cur.get(), "k"), 0);
    EXPECT_TRUE(currentData(cur.get()) == patternBytes(10000, 1));
}

TEST(EnginePageSize, FixedOnceTheWriteTransactionBegins) {
    TestEngine engine;  // the store's settings, transaction begun
    ASSERT_EQ(engine.beginRc, SQLITE_OK);
    for (int size : {512, 4096, 8192, 32768})
        EXPECT_EQ(sqlite3BtreeSetPageSize(engine.get(), size, -1), SQLITE_READONLY) << size;
    std::uint32_t root = engine.createTable(kByteTable);
    ASSERT_NE(root, 0u);
    EXPECT_EQ(sqlite3BtreeSetPageSize(engine.get(), 1024, -1), SQLITE_READONLY);
    // Still working after the refusals.
    TestCursor cur(engine.get(), root, 1);
    EXPECT_EQ(insertBytes(cur.get(), "k", "v"), SQLITE_OK);
    EXPECT_EQ(walkBytes(cur.get()).size(), 1u);
}

// ---------------------------------------------------------------------------
// Rule 11: sizes on no entry.

TEST(EngineSizes, KeySizeAndDataSizeAreZeroOnNoEntry) {
    for (int flags : {kByteTable, kIntTable, kKeyOnlyTable}) {
        SCOPED_TRACE("flags " + std::to_string(flags));
        TestEngine engine;
        std::uint32_t root = engine.createTable(flags);
        TestCursor cur(engine.get(), root, 1);
        auto expectZero = [&](const char* state) {
            std::int64_t keySize = 77;
            EXPECT_EQ(sqlite3BtreeKeySize(cur.get(), &keySize), SQLITE_OK) << state;
            EXPECT_EQ(keySize, 0) << state;
            std::uint32_t dataSize = 77;
            EXPECT_EQ(sqlite3BtreeDataSize(cur.get(), &dataSize), SQLITE_OK) << state;
            EXPECT_EQ(dataSize, 0u) << state;
        };
        expectZero("never positioned, empty table");
        int res = kFlagSentinel;
        ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
        expectZero("First on an empty table");
        const bool intKey = (flags & BTREE_INTKEY) != 0;
        ASSERT_EQ(intKey ? insertInt(cur.get(), 9, "data") : insertBytes(cur.get(), "key", "data"),
                  SQLITE_OK);
        expectZero("after an insert");
        ASSERT_EQ(sqlite3BtreeLast(cur.get(), &res), SQLITE_OK);
        ASSERT_EQ(sqlite3BtreeNext(cur.get(), &res), SQLITE_OK);
        ASSERT_EQ(res, 1);
        expectZero("past the last entry");
    }
}

// ---------------------------------------------------------------------------
// Handles: cursors left open across Close.

// A move on an inert cursor either succeeds reporting no entry or fails
// without writing its flag.
void expectNoEntryMove(int rc, int flag, const char* what) {
    if (rc == SQLITE_OK) {
        EXPECT_EQ(flag, 1) << what;
    } else {
        EXPECT_EQ(flag, kFlagSentinel) << what << " failed (" << rc << ") but wrote its flag";
    }
}

TEST(EngineClose, CursorsLeftOpenBecomeInert) {
    BtCursor* reader = nullptr;
    BtCursor* writer = nullptr;
    BtCursor* intWriter = nullptr;
    {
        TestEngine engine;
        std::uint32_t root = engine.createTable(kByteTable);
        std::uint32_t intRoot = engine.createTable(kIntTable);
        std::uint32_t other = engine.createTable(kByteTable);
        ASSERT_EQ(sqlite3BtreeCursor(engine.get(), other, 1, nullptr, nullptr, &writer), SQLITE_OK);
        ASSERT_EQ(sqlite3BtreeCursor(engine.get(), intRoot, 1, nullptr, nullptr, &intWriter),
                  SQLITE_OK);
        ASSERT_EQ(insertBytes(writer, "w", "wd"), SQLITE_OK);
        ASSERT_EQ(insertInt(intWriter, 4, "id"), SQLITE_OK);
        {
            TestCursor w(engine.get(), root, 1);
            ASSERT_EQ(insertBytes(w.get(), "k", "data"), SQLITE_OK);
        }
        ASSERT_EQ(sqlite3BtreeCursor(engine.get(), root, 0, nullptr, nullptr, &reader), SQLITE_OK);
        ASSERT_EQ(seekBytes(reader, "k"), 0);
        ASSERT_EQ(seekBytes(writer, "w"), 0);
        ASSERT_EQ(seekInt(intWriter, 4), 0);
        EXPECT_EQ(engine.close(), SQLITE_OK);
    }
    for (BtCursor* cur : {reader, writer, intWriter}) {
        EXPECT_NE(sqlite3BtreeEof(cur), 0);
        int flag = kFlagSentinel;
        int rc = sqlite3BtreeFirst(cur, &flag);
        expectNoEntryMove(rc, flag, "First");
        flag = kFlagSentinel;
        rc = sqlite3BtreeLast(cur, &flag);
        expectNoEntryMove(rc, flag, "Last");
        flag = kFlagSentinel;
        rc = sqlite3BtreeNext(cur, &flag);
        expectNoEntryMove(rc, flag, "Next");
        flag = kFlagSentinel;
        rc = sqlite3BtreePrevious(cur, &flag);
        expectNoEntryMove(rc, flag, "Previous");
        int cmp = kFlagSentinel;
        rc = cur == intWriter ? sqlite3BtreeMoveto(cur, nullptr, 4, &cmp)
                              : sqlite3BtreeMoveto(cur, "k", 1, &cmp);
        if (rc == SQLITE_OK) {
            EXPECT_LT(cmp, 0) << "Moveto on an inert cursor found something";
        }
        EXPECT_NE(sqlite3BtreeEof(cur), 0);

        std::int64_t keySize = 77;
        rc = sqlite3BtreeKeySize(cur, &keySize);
        EXPECT_EQ(keySize, rc == SQLITE_OK ? 0 : 77);
        std::uint32_t dataSize = 77;
        rc = sqlite3BtreeDataSize(cur, &dataSize);
        EXPECT_EQ(dataSize, rc == SQLITE_OK ? 0u : 77u);

        auto k = readKey(cur, 0, 1, 8);
        EXPECT_NE(k.first, SQLITE_OK);
        EXPECT_EQ(k.second, std::string(8, kFill));
        auto d = readData(cur, 0, 1, 8);
        EXPECT_NE(d.first, SQLITE_OK);
        EXPECT_EQ(d.second, std::string(8, kFill));

        EXPECT_NE(insertBytes(cur, "new", "x"), SQLITE_OK);
        EXPECT_NE(insertInt(cur, 5, "x"), SQLITE_OK);
        EXPECT_NE(sqlite3BtreeEof(cur), 0);
    }
    // Closing frees them; the leak checker would report them otherwise.
    EXPECT_EQ(sqlite3BtreeCloseCursor(reader), SQLITE_OK);
    EXPECT_EQ(sqlite3BtreeCloseCursor(writer), SQLITE_OK);
    EXPECT_EQ(sqlite3BtreeCloseCursor(intWriter), SQLITE_OK);
}

TEST(EngineClose, NewEngineAfterCloseStartsEmpty) {
    std::uint32_t root = 0;
    {
        TestEngine engine;
        root = engine.createTable(kByteTable);
        TestCursor cur(engine.get(), root, 1);
        ASSERT_EQ(insertBytes(cur.get(), "k", "v"), SQLITE_OK);
        // Closed with the cursor still open.
        EXPECT_EQ(engine.close(), SQLITE_OK);
    }
    TestEngine engine;
    std::uint32_t fresh = engine.createTable(kByteTable);
    ASSERT_NE(fresh, 0u);
    TestCursor cur(engine.get(), fresh, 0);
    int res = kFlagSentinel;
    ASSERT_EQ(sqlite3BtreeFirst(cur.get(), &res), SQLITE_OK);
    EXPECT_EQ(res, 1);
}

TEST(EngineClose, CloseWithoutTransactionOrTables) {
    Btree* p = nullptr;
    ASSERT_EQ(sqlite3BtreeOpen(nullptr, nullptr, &p, 0), SQLITE_OK);
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(sqlite3BtreeClose(p), SQLITE_OK);
    p = nullptr;
    ASSERT_EQ(sqlite3BtreeOpen(nullptr, nullptr, &p, BTREE_OMIT_JOURNAL | BTREE_NO_READLOCK),
              SQLITE_OK);
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(sqlite3BtreeClose(p), SQLITE_OK);
}

}  // namespace
