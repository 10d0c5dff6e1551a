// The engine binding against raw SQLite: the same workloads through the
// B-tree operations the store calls (opened, sized and begun exactly as the
// pager does, one writing cursor per table) and through hand-written SQL on
// a connection with the same settings, both in the same run.
//
//     engine_benchmark [--kov_bench_n=N] [Google Benchmark flags]
//     KOV_BENCH_N=20000 engine_benchmark        (a quick run)
//
// Workloads, N = workload size (1 000 000 unless set):
//   BM_SeqIntInsert      N inserts of the integer keys 0..N-1 with 100-byte data
//   BM_RandomBlobInsert  N inserts of random 16-byte keys with 100-byte data
//   BM_OrderedScan       a full ordered walk of the N random-key entries, key and data read
//   BM_RandomSeek        N/10 seeks of existing random keys, data read
//   BM_CountDraws        N draws of 16-byte keys from a skewed law, each key's count read
//                        and written back plus one (raw: one upsert), then the counts walked
// Inserts start from an empty table in a fresh database every iteration and end, inside the
// timing, with the entries read back (the first entry and the last key inserted).
// Counters: bind_ns and raw_ns, processor nanoseconds per operation; ratio =
// bind / raw on processor time, wall_ratio the same on elapsed time. The Time
// column is the binding's elapsed time per iteration.

// The binding's header first: its result codes share <sqlite3.h>'s macro
// names.
#include "engine/btree.h"

#include <benchmark/benchmark.h>

#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "bench/bench_util.h"
#include "bench/paired_workloads.h"
#include "bench/raw_sqlite.h"
#include "kov_test_access.h"

namespace {

namespace eng = kov::engine;
using kov::bench::kDataSize;
using kov::bench::Key16;
using kov::bench::Payload;
using kov::bench::RawBlobTable;
using kov::bench::RawCountTable;
using kov::bench::RawDatabase;
using kov::bench::RawIntTable;
using kov::bench::Tally;

constexpr int kIntKeyFlags = eng::BTREE_INTKEY | eng::BTREE_LEAFDATA;
constexpr int kBlobFlags = 0;

void check(int rc, const char* what) {
    if (rc != SQLITE_OK) {
        throw std::runtime_error(std::string("engine ") + what + ": result " + std::to_string(rc));
    }
}

// One engine handle, set up as the pager sets it up: the store's page size
// and page-cache size, one write transaction.
class Engine {
  public:
    Engine() {
        check(eng::sqlite3BtreeOpen(nullptr, nullptr, &p_, 3), "open");
        check(eng::sqlite3BtreeSetPageSize(p_, static_cast<int>(KovTestAccess::defaultPageSize()),
                                           -1),
              "page size");
        check(
            eng::sqlite3BtreeSetCacheSize(p_, static_cast<int>(KovTestAccess::defaultCacheSize())),
            "cache size");
        check(eng::sqlite3BtreeBeginTrans(p_, 2), "begin");
    }
    ~Engine() { eng::sqlite3BtreeClose(p_); }
    Engine(const Engine&) = delete;
    Engine& operator=(const Engine&) = delete;

    std::uint32_t createTable(int flags) {
        std::uint32_t root = 0;
        check(eng::sqlite3BtreeCreateTable(p_, &root, flags), "create table");
        return root;
    }
    eng::Btree* get() const { return p_; }

  private:
    eng::Btree* p_ = nullptr;
};

// A raw table and an engine byte-keyed table side by side.
template <class RawTable>
struct TablePair {
    RawDatabase rawDb;
    RawTable rawTable{rawDb};
    Engine engine;
    std::uint32_t root = engine.createTable(kBlobFlags);
};
using BlobPair = TablePair<RawBlobTable>;

// A writing cursor, closed on destruction, with what the workloads do
// through it.
class EngineCursor {
  public:
    EngineCursor(Engine& engine, std::uint32_t root) {
        check(eng::sqlite3BtreeCursor(engine.get(), root, 1, nullptr, nullptr, &c_), "cursor");
    }
    template <class RawTable>
    explicit EngineCursor(TablePair<RawTable>& set) : EngineCursor(set.engine, set.root) {}
    ~EngineCursor() { eng::sqlite3BtreeCloseCursor(c_); }
    EngineCursor(const EngineCursor&) = delete;
    EngineCursor& operator=(const EngineCursor&) = delete;

    void insert(std::int64_t key, const unsigned char* data, std::size_t size) {
        check(eng::sqlite3BtreeInsert(c_, nullptr, key, data, static_cast<int>(size)), "insert");
    }
    void insert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                std::size_t size) {
        check(eng::sqlite3BtreeInsert(c_, key, static_cast<std::int64_t>(keySize), data,
                                      static_cast<int>(size)),
              "insert");
    }

    // The key's 8-byte count read when there, then count + 1 (or 1) inserted.
    void increment(const Key16& key) {
        std::uint64_t count = 0;
        if (moveTo(key.data(), static_cast<std::int64_t>(key.size())) == 0) {
            check(eng::sqlite3BtreeData(c_, 0, sizeof count, &count), "data");
        }
        ++count;
        insert(key.data(), key.size(), reinterpret_cast<const unsigned char*>(&count),
               sizeof count);
    }

    bool readable(std::int64_t key) { return step(false) && moveTo(nullptr, key) == 0; }
    bool readable(const unsigned char* key, std::size_t keySize) {
        return step(false) && moveTo(key, static_cast<std::int64_t>(keySize)) == 0;
    }

    bool step(bool started) {
        int atEnd = 1;
        check(started ? eng::sqlite3BtreeNext(c_, &atEnd) : eng::sqlite3BtreeFirst(c_, &atEnd),
              "step");
        return atEnd == 0;
    }
    void readEntry(std::vector<unsigned char>& keyBuf, std::vector<unsigned char>& dataBuf,
                   Tally& tally) {
        std::int64_t keySize = 0;
        std::uint32_t dataSize = 0;
        check(eng::sqlite3BtreeKeySize(c_, &keySize), "key size");
        check(eng::sqlite3BtreeDataSize(c_, &dataSize), "data size");
        if (static_cast<std::uint64_t>(keySize) > keyBuf.size() || dataSize > dataBuf.size()) {
            throw std::runtime_error("engine scan: entry larger than expected");
        }
        check(eng::sqlite3BtreeKey(c_, 0, static_cast<std::uint32_t>(keySize), keyBuf.data()),
              "key");
        check(eng::sqlite3BtreeData(c_, 0, dataSize, dataBuf.data()), "data");
        tally.add(keyBuf.data(), static_cast<std::size_t>(keySize), dataBuf.data());
    }

    void readCount(std::vector<unsigned char>& keyBuf, Tally& tally) {
        std::int64_t keySize = 0;
        check(eng::sqlite3BtreeKeySize(c_, &keySize), "key size");
        if (static_cast<std::uint64_t>(keySize) > keyBuf.size()) {
            throw std::runtime_error("engine walk: key larger than expected");
        }
        check(eng::sqlite3BtreeKey(c_, 0, static_cast<std::uint32_t>(keySize), keyBuf.data()),
              "key");
        std::uint64_t count = 0;
        check(eng::sqlite3BtreeData(c_, 0, sizeof count, &count), "data");
        tally.addCount(count);
    }

    void seekEntry(const Key16& key, std::vector<unsigned char>& buffer, Tally& tally) {
        if (moveTo(key.data(), static_cast<std::int64_t>(key.size())) != 0) {
            return;
        }
        std::uint32_t dataSize = 0;
        check(eng::sqlite3BtreeDataSize(c_, &dataSize), "data size");
        if (dataSize < 8 || dataSize > buffer.size()) {
            return;
        }
        check(eng::sqlite3BtreeData(c_, 0, dataSize, buffer.data()), "data");
        tally.add(key.data(), key.size(), buffer.data());
    }

  private:
    // Moves next to the key (bytes and length, or a null pointer and the
    // integer key) and returns the comparison (engine/btree.h, rule 2).
    int moveTo(const void* key, std::int64_t keySize) {
        int cmp = -1;
        check(eng::sqlite3BtreeMoveto(c_, key, keySize, &cmp), "seek");
        return cmp;
    }

    eng::BtCursor* c_ = nullptr;
};

// The filled random-key tables that the scan and seek workloads read: the
// last ones BM_RandomBlobInsert filled, or filled here when it did not run.
std::unique_ptr<BlobPair> gRandomSet;
std::size_t gRandomSetSize = 0;

// The engine binding as the measured side of the shared workloads
// (bench/paired_workloads.h).
struct EngineSide {
    static constexpr char kName[] = "bind";

    using BlobSet = BlobPair;
    using Cursor = EngineCursor;
    using CountSet = TablePair<RawCountTable>;

    // A raw integer-keyed table and an engine one, in a database each.
    struct IntSet {
        RawDatabase rawDb;
        RawIntTable rawTable{rawDb};
        Engine engine;
        Cursor cursor{engine, engine.createTable(kIntKeyFlags)};
        void checkFilled(std::size_t /*n: the engine side checks nothing more*/) const {}
    };

    static std::unique_ptr<BlobPair> newBlobSet() { return std::make_unique<BlobPair>(); }

    static BlobPair& randomSet(std::size_t n) {
        if (gRandomSet == nullptr || gRandomSetSize != n) {
            gRandomSet.reset();
            auto set = newBlobSet();
            const std::vector<Key16>& keys = kov::bench::workloadKeys(n);
            Payload data;
            Cursor cursor(*set);
            for (std::size_t i = 0; i < n; ++i) {
                set->rawTable.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
                cursor.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
            }
            gRandomSet = std::move(set);
            gRandomSetSize = n;
        }
        return *gRandomSet;
    }
    static void keepRandomSet(std::unique_ptr<BlobPair> set, std::size_t n) {
        gRandomSet = std::move(set);
        gRandomSetSize = n;
    }
    static void dropRandomSet() { gRandomSet.reset(); }
};

}  // namespace

int main(int argc, char** argv) {
    std::int64_t n = 0;
    if (!kov::bench::initialize(&argc, argv, &n)) {
        return 1;
    }
    kov::bench::runWorkloads(n, kov::bench::sharedWorkloads<EngineSide>());
    gRandomSet.reset();
    return 0;
}
