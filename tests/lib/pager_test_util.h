// Helpers for the store's tests: string-based wrappers over the cursor's pointer-and-size
// interface, and a fixture that starts every test on an open engine with an empty registry.
#ifndef KOVPAGER_TESTS_PAGER_TEST_UTIL_H
#define KOVPAGER_TESTS_PAGER_TEST_UTIL_H

#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>

#include "engine_test_util.h"
#include "kov_test_access.h"

namespace kovtest {

// SQLite's integrity check of the store's whole database: empty when it finds nothing (or when
// the engine is closed), else what it found.
inline std::string storeIntegrityProblems() {
    kov::engine::Btree* engine = KovTestAccess::engine();
    return engine == nullptr ? std::string() : kov::engine::test::integrityProblems(engine);
}

constexpr std::uint32_t kFreeSlot = kov::pager::CursorSlot::freeSlot_;

inline void insertBytes(KovBtreeCursor& c, const std::string& key, const std::string& data) {
    c.insert(key.data(), key.size(), data.data(), data.size());
}

inline void insertKey(KovBtreeCursor& c, const std::string& key) {
    c.insert(key.data(), key.size());
}

inline void insertInt(KovBtreeCursor& c, std::int64_t key, const std::string& data) {
    c.insert(key, data.data(), data.size());
}

inline std::int32_t seekBytes(KovBtreeCursor& c, const std::string& key) {
    return c.seek(key.data(), key.size());
}

inline std::int64_t intKey(KovBtreeCursor& c) {
    std::int64_t k = -12345;
    c.key(k);
    return k;
}

// The current byte-string key, read with the test seam of the private key reader.
inline std::string byteKey(KovBtreeCursor& c) {
    std::string k(static_cast<std::size_t>(KovTestAccess::keySize(c)), '\0');
    KovTestAccess::key(c, k.data(), k.size());
    return k;
}

inline std::string dataOf(KovBtreeCursor& c) {
    std::string d(static_cast<std::size_t>(c.dataSize()), '\0');
    c.data(d.data(), d.size());
    return d;
}

// Every (key, data) pair of a byte-string table, walked forward.
inline std::vector<std::pair<std::string, std::string>> walkBytes(KovBtreeCursor& c) {
    std::vector<std::pair<std::string, std::string>> out;
    for (bool on = c.first(); on; on = c.next())
        out.emplace_back(byteKey(c), dataOf(c));
    return out;
}

inline std::vector<std::pair<std::int64_t, std::string>> walkInts(KovBtreeCursor& c) {
    std::vector<std::pair<std::int64_t, std::string>> out;
    for (bool on = c.first(); on; on = c.next())
        out.emplace_back(intKey(c), dataOf(c));
    return out;
}

inline const kov::pager::CursorSlot& slotOf(const KovBtreeCursor& c) {
    return KovTestAccess::slots().at(static_cast<std::size_t>(KovTestAccess::slotIndex(c)));
}

// A writer refused because a reader is open on its table: it has no engine cursor and every
// move answers false, as on no entry.
inline void expectRefusedWriter(KovBtreeCursor& refused) {
    EXPECT_EQ(slotOf(refused).cursor, nullptr);
    EXPECT_FALSE(refused.first());
    EXPECT_FALSE(refused.last());
    EXPECT_FALSE(refused.next());
    EXPECT_FALSE(refused.previous());
    EXPECT_FALSE(refused.good());
}

// Every test starts on an open engine with no registered cursor. A test that leaves slots behind
// on purpose (after reset) ends with KovTestAccess::teardown().
class StoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        KovPager::instance()->reset();
        KovBtree opener(KovBtree::IndexTable);  // reopens the engine
        ASSERT_TRUE(KovTestAccess::slots().empty());
        ASSERT_NE(KovTestAccess::engine(), nullptr);
    }
    void TearDown() override { EXPECT_TRUE(KovTestAccess::slots().empty()); }
};

// A copy of the process's pager in storage of the test's own (a copy's destructor is private;
// KovTestAccess runs it without touching the engine the copy shares).
class PagerCopy {
  public:
    PagerCopy() : pager_(new (storage_) KovPager(*KovPager::instance())) {}
    ~PagerCopy() { KovTestAccess::disposeCopy(pager_); }
    PagerCopy(const PagerCopy&) = delete;
    PagerCopy& operator=(const PagerCopy&) = delete;
    KovPager& operator*() { return *pager_; }
    KovPager* operator->() { return pager_; }

  private:
    alignas(KovPager) unsigned char storage_[sizeof(KovPager)];
    KovPager* pager_;
};

inline bool contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

// Inserts integer keys 0, 1, ... with `size` bytes of data until the store reports a failure (or
// `limit` keys are in); returns how many inserts were made, the refused one included.
inline std::int64_t insertUntilFailed(KovBtreeCursor& c, std::size_t size,
                                      std::int64_t limit = 10000) {
    const std::string data(size, 'd');
    std::int64_t k = 0;
    while (k < limit && !KovPager::instance()->failed()) {
        c.insert(k, data.data(), data.size());
        ++k;
    }
    return k;
}

// Points the store at another temporary directory (the engine reads it each time it makes its
// file); the pager's own one comes back on destruction.
class TempDirOverride {
  public:
    explicit TempDirOverride(const std::string& dir) : saved_(pagerDir()) {
        pagerDir() = dir;
        kov::engine::temporaryDirectorySetting() = pagerDir().data();
    }
    ~TempDirOverride() {
        pagerDir() = saved_;
        kov::engine::temporaryDirectorySetting() = pagerDir().data();
    }
    TempDirOverride(const TempDirOverride&) = delete;
    TempDirOverride& operator=(const TempDirOverride&) = delete;

  private:
    static std::string& pagerDir() { return KovTestAccess::tempDir(KovPager::instance()); }
    std::string saved_;
};

}  // namespace kovtest

#endif  // KOVPAGER_TESTS_PAGER_TEST_UTIL_H
