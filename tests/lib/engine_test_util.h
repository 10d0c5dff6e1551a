// Small helpers for the engine binding's tests: an engine opened the way the
// store opens it, cursors that close themselves, and readers that return a
// cursor's current key and data as strings.
#ifndef KOVPAGER_TESTS_ENGINE_TEST_UTIL_H
#define KOVPAGER_TESTS_ENGINE_TEST_UTIL_H

#include <cstdint>
#include <string>
#include <utility>
#include <vector>

#include "engine/btree.h"
#include "kov_test_access.h"

namespace kov::engine::test {

// Sets how the engines opened from now on gather their loads (engine/btree.h, Loads), for as
// long as it lives.
class ScopedLoadLimits {
  public:
    explicit ScopedLoadLimits(LoadLimits limits) : previous_(TEST_setLoadLimits(limits)) {}
    ~ScopedLoadLimits() { TEST_setLoadLimits(previous_); }
    ScopedLoadLimits(const ScopedLoadLimits&) = delete;
    ScopedLoadLimits& operator=(const ScopedLoadLimits&) = delete;

  private:
    LoadLimits previous_;
};

// Every insert straight into its B-tree, as before loads were gathered.
constexpr LoadLimits kStraightLoads{kDefaultLoadLimits.bufferBytes, UINT32_MAX};
// A buffer of a few entries, gathered from the second insert after a read: runs and merges
// within a few dozen inserts.
constexpr LoadLimits kTinyLoads{1024, 1};

// Table kinds as the store creates them.
constexpr int kByteTable = 0;                             // byte-string key with data
constexpr int kIntTable = BTREE_INTKEY | BTREE_LEAFDATA;  // integer key with data
constexpr int kKeyOnlyTable = BTREE_ZERODATA;             // byte-string key only

// An engine opened with the store's settings: flags 3, the pager's page and
// cache sizes, an exclusive write transaction. Closed on destruction unless
// closed (or released) earlier.
class TestEngine {
  public:
    explicit TestEngine(bool beginWrite = true) {
        openRc =
            sqlite3BtreeOpen(nullptr, nullptr, &handle, BTREE_OMIT_JOURNAL | BTREE_NO_READLOCK);
        if (handle != nullptr) {
            pageSizeRc = sqlite3BtreeSetPageSize(
                handle, static_cast<int>(KovTestAccess::defaultPageSize()), -1);
            cacheSizeRc = sqlite3BtreeSetCacheSize(
                handle, static_cast<int>(KovTestAccess::defaultCacheSize()));
            if (beginWrite)
                beginRc = sqlite3BtreeBeginTrans(handle, 2);
        }
    }
    ~TestEngine() { close(); }
    TestEngine(const TestEngine&) = delete;
    TestEngine& operator=(const TestEngine&) = delete;

    Btree* get() const { return handle; }

    // Closes the engine now; returns the close's result code.
    int close() {
        int rc = SQLITE_OK;
        if (handle != nullptr)
            rc = sqlite3BtreeClose(handle);
        handle = nullptr;
        return rc;
    }

    // Creates a table of the given kind; returns its root page, 0 on failure.
    std::uint32_t createTable(int flags) {
        std::uint32_t root = 0;
        if (sqlite3BtreeCreateTable(handle, &root, flags) != SQLITE_OK)
            return 0;
        return root;
    }

    int openRc = -1;
    int pageSizeRc = -1;
    int cacheSizeRc = -1;
    int beginRc = -1;

  private:
    Btree* handle = nullptr;
};

// A cursor closed on destruction. `rc` holds the open's result code.
class TestCursor {
  public:
    TestCursor(Btree* engine, std::uint32_t root, int wrFlag) {
        rc = sqlite3BtreeCursor(engine, root, wrFlag, nullptr, nullptr, &handle);
    }
    ~TestCursor() { close(); }
    TestCursor(const TestCursor&) = delete;
    TestCursor& operator=(const TestCursor&) = delete;

    BtCursor* get() const { return handle; }
    int close() {
        int closeRc = SQLITE_OK;
        if (handle != nullptr)
            closeRc = sqlite3BtreeCloseCursor(handle);
        handle = nullptr;
        return closeRc;
    }

    int rc = -1;

  private:
    BtCursor* handle = nullptr;
};

// Inserts a byte-string key with data (data ignored on key-only tables).
inline int insertBytes(BtCursor* cur, const std::string& key, const std::string& data = {}) {
    return sqlite3BtreeInsert(cur, key.data(), static_cast<std::int64_t>(key.size()), data.data(),
                              static_cast<int>(data.size()));
}

// Inserts an integer key with data.
inline int insertInt(BtCursor* cur, std::int64_t key, const std::string& data = {}) {
    return sqlite3BtreeInsert(cur, nullptr, key, data.data(), static_cast<int>(data.size()));
}

// Moves to a byte-string key; returns the comparison result, or `failed`
// when the move is refused.
inline int seekBytes(BtCursor* cur, const std::string& key, int failed = -1000) {
    int res = failed;
    if (sqlite3BtreeMoveto(cur, key.data(), static_cast<std::int64_t>(key.size()), &res) !=
        SQLITE_OK)
        return failed;
    return res;
}

inline int seekInt(BtCursor* cur, std::int64_t key, int failed = -1000) {
    int res = failed;
    if (sqlite3BtreeMoveto(cur, nullptr, key, &res) != SQLITE_OK)
        return failed;
    return res;
}

// The current entry's byte-string key ("" on no entry or on failure).
inline std::string currentKey(BtCursor* cur) {
    std::int64_t size = 0;
    if (sqlite3BtreeKeySize(cur, &size) != SQLITE_OK || size <= 0)
        return {};
    std::string key(static_cast<std::size_t>(size), '\0');
    if (sqlite3BtreeKey(cur, 0, static_cast<std::uint32_t>(size), key.data()) != SQLITE_OK)
        return "<key read failed>";
    return key;
}

// The current entry's integer key (KeySize on an integer-keyed table).
inline std::int64_t currentIntKey(BtCursor* cur) {
    std::int64_t key = 0;
    sqlite3BtreeKeySize(cur, &key);
    return key;
}

// The current entry's data ("" on no entry or on failure).
inline std::string currentData(BtCursor* cur) {
    std::uint32_t size = 0;
    if (sqlite3BtreeDataSize(cur, &size) != SQLITE_OK || size == 0)
        return {};
    std::string data(size, '\0');
    if (sqlite3BtreeData(cur, 0, size, data.data()) != SQLITE_OK)
        return "<data read failed>";
    return data;
}

// Every entry of a byte-string table in cursor order, walking forward.
inline std::vector<std::pair<std::string, std::string>> walkBytes(BtCursor* cur) {
    std::vector<std::pair<std::string, std::string>> out;
    int res = 1;
    if (sqlite3BtreeFirst(cur, &res) != SQLITE_OK)
        return out;
    while (res == 0) {
        out.emplace_back(currentKey(cur), currentData(cur));
        if (sqlite3BtreeNext(cur, &res) != SQLITE_OK)
            break;
    }
    return out;
}

// Every entry of an integer-keyed table in cursor order, walking forward.
inline std::vector<std::pair<std::int64_t, std::string>> walkInts(BtCursor* cur) {
    std::vector<std::pair<std::int64_t, std::string>> out;
    int res = 1;
    if (sqlite3BtreeFirst(cur, &res) != SQLITE_OK)
        return out;
    while (res == 0) {
        out.emplace_back(currentIntKey(cur), currentData(cur));
        if (sqlite3BtreeNext(cur, &res) != SQLITE_OK)
            break;
    }
    return out;
}

// SQLite's integrity check of the whole database behind an engine: empty when
// it finds nothing, else what it found (or why it could not run).
inline std::string integrityProblems(Btree* engine) {
    int problems = 0;
    std::string report;
    int rc = sqlite3BtreeIntegrityCheck(engine, 20, &problems, &report);
    if (rc != SQLITE_OK)
        return "the integrity check could not run: result code " + std::to_string(rc);
    if (problems == 0)
        return {};
    return std::to_string(problems) + " problem(s): " + report;
}

// A string of `n` bytes that differ from position to position, seeded so
// that different seeds give different bytes.
inline std::string patternBytes(std::size_t n, unsigned seed) {
    std::string s(n, '\0');
    std::uint32_t x = seed * 2654435761u + 12345u;
    for (std::size_t i = 0; i < n; ++i) {
        x = x * 1103515245u + 12345u;
        s[i] = static_cast<char>(x >> 24);
    }
    return s;
}

}  // namespace kov::engine::test

#endif  // KOVPAGER_TESTS_ENGINE_TEST_UTIL_H
