// The store's public classes against raw SQLite: the same workloads through
// KovBtree and KovBtreeCursor, as a host uses them, and through hand-written
// SQL on a connection with the store's settings, both in the same run.
//
//     store_benchmark [--kov_bench_n=N] [Google Benchmark flags]
//     KOV_BENCH_N=20000 store_benchmark         (a quick run)
//
// Workloads, N = workload size (1 000 000 unless set):
//   BM_SeqIntInsert      N inserts of the integer keys 0..N-1 with 100-byte data
//   BM_RandomBlobInsert  N inserts of random 16-byte keys with 100-byte data
//   BM_OrderedScan       a full ordered walk of the N random-key entries, key and data read
//   BM_RandomSeek        N/10 seeks of existing random keys, data read
//   BM_CountDraws        N draws of 16-byte keys from a skewed law, each key's count read
//                        and written back plus one (raw: one upsert), then the counts walked
//   BM_CompositeInsert   N key-only inserts, random order, of 16-byte composite keys: an
//                        8-byte prefix naming one of 1 000 groups, then an 8-byte payload
//   BM_PrefixWalk        every group walked by its prefix, payload read (ns per entry)
// Inserts start from an empty table every iteration and end, inside the timing, with the
// entries read back (the first entry and the last key inserted). Counters: store_ns and
// raw_ns, processor nanoseconds per operation; ratio = store / raw on
// processor time, wall_ratio the same on elapsed time. The Time column is
// the store's elapsed time per iteration.
//
// The store is one per process: its tables live until destroyed, and a table
// is dropped only while no cursor is open anywhere, so every cursor here is
// destroyed before any table.
#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "bench/bench_util.h"
#include "bench/paired_workloads.h"
#include "bench/raw_sqlite.h"
#include "bench/store_ops.h"

namespace {

using kov::bench::CompositeKeys;
using kov::bench::kDataSize;
using kov::bench::Key16;
using kov::bench::PairedRun;
using kov::bench::Payload;
using kov::bench::RawBlobTable;
using kov::bench::RawCountTable;
using kov::bench::RawDatabase;
using kov::bench::RawIntTable;
using kov::bench::RawKeyTable;
using kov::bench::Tally;

constexpr std::size_t kWalkChunk = 8;  // groups

// A raw table and a store table of the same kind, side by side.
template <class RawTable>
struct TablePair {
    explicit TablePair(KovBtree::TableType type) : table(type) {}
    RawDatabase rawDb;
    RawTable rawTable{rawDb};
    KovBtree table;
};
using BlobPair = TablePair<RawBlobTable>;
using KeyPair = TablePair<RawKeyTable>;

// A writing cursor on a store table, with what the shared workloads do
// through it.
class StoreCursor {
  public:
    explicit StoreCursor(KovBtree& table) : c_(table, true) {}
    template <class RawTable>
    explicit StoreCursor(TablePair<RawTable>& set) : StoreCursor(set.table) {}

    KovBtreeCursor& get() { return c_; }

    void insert(std::int64_t key, const unsigned char* data, std::size_t size) {
        c_.insert(key, data, size);
    }
    void insert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                std::size_t size) {
        c_.insert(key, keySize, data, size);
    }
    void increment(const Key16& key) { kov::bench::storeIncrement(c_, key.data(), key.size()); }

    bool readable(std::int64_t key) { return kov::bench::storeReadable(c_, key); }
    bool readable(const unsigned char* key, std::size_t keySize) {
        return kov::bench::storeReadable(c_, key, keySize);
    }

    bool step(bool started) { return started ? c_.next() : c_.first(); }
    void readEntry(std::vector<unsigned char>& /*keyBuf: the key goes to a string*/,
                   std::vector<unsigned char>& dataBuf, Tally& tally) {
        // The whole key: the public fetch with an empty prefix.
        c_.indexKeyFetch("", 0, key_);
        auto dataSize = static_cast<std::uint64_t>(c_.dataSize());
        if (dataSize > dataBuf.size()) {
            throw std::runtime_error("store scan: entry larger than expected");
        }
        c_.data(dataBuf.data(), dataSize);
        tally.add(reinterpret_cast<const unsigned char*>(key_.data()), key_.size(), dataBuf.data());
    }

    void readCount(std::vector<unsigned char>& /*keyBuf: the key goes to a string*/, Tally& tally) {
        c_.indexKeyFetch("", 0, key_);
        std::uint64_t count = 0;
        c_.data(&count, sizeof count);
        tally.addCount(count);
    }

    void seekEntry(const Key16& key, std::vector<unsigned char>& buffer, Tally& tally) {
        if (c_.seek(key.data(), key.size()) != 0) {
            return;
        }
        auto dataSize = static_cast<std::uint64_t>(c_.dataSize());
        if (dataSize < 8 || dataSize > buffer.size()) {
            return;
        }
        c_.data(buffer.data(), dataSize);
        tally.add(key.data(), key.size(), buffer.data());
    }

  private:
    KovBtreeCursor c_;
    std::string key_;
};

// The N composite keys of the workloads in insertion order, with their
// generator (which also gives the walk order), made on first use and kept.
struct CompositeSet {
    CompositeKeys groups;
    std::vector<Key16> keys;
    std::size_t distinct = 0;  // distinct keys among `keys`
};
const CompositeSet& compositeKeys(std::size_t n) {
    static CompositeSet c;
    if (c.keys.size() != n) {
        c.groups = CompositeKeys();
        c.keys.resize(n);
        for (Key16& k : c.keys) {
            k = c.groups.next();
        }
        c.distinct = kov::bench::distinctKeys(c.keys);
    }
    return c;
}

// The filled tables the read workloads use: the last ones the insert
// workload filled, or filled on first use when it did not run.
std::unique_ptr<BlobPair> gRandomSet;
std::unique_ptr<KeyPair> gCompositeSet;

// The store's public classes as the measured side of the shared workloads
// (bench/paired_workloads.h).
struct StoreSide {
    static constexpr char kName[] = "store";

    using BlobSet = BlobPair;
    using Cursor = StoreCursor;

    // A raw count table and a store BlobTable of 8-byte counts.
    struct CountSet : TablePair<RawCountTable> {
        CountSet() : TablePair(KovBtree::BlobTable) {}
    };

    // A raw integer-keyed table and a store one.
    struct IntSet : TablePair<RawIntTable> {
        IntSet() : TablePair(KovBtree::IntKeyTable) {}
        StoreCursor cursor{table};

        // A cheap check that the store took every entry.
        void checkFilled(std::size_t n) {
            std::int64_t lastKey = -1;
            if (cursor.get().last()) {
                cursor.get().key(lastKey);
            }
            if (lastKey != static_cast<std::int64_t>(n - 1)) {
                throw std::runtime_error("store: the last inserted key is missing");
            }
        }
    };

    static std::unique_ptr<BlobPair> newBlobSet() {
        return std::make_unique<BlobPair>(KovBtree::BlobTable);
    }

    static BlobPair& randomSet(std::size_t n) {
        static std::size_t size = 0;
        if (gRandomSet == nullptr || size != n) {
            gRandomSet.reset();
            gRandomSet = newBlobSet();
            const std::vector<Key16>& keys = kov::bench::workloadKeys(n);
            Payload data;
            StoreCursor cursor(*gRandomSet);
            for (std::size_t i = 0; i < n; ++i) {
                gRandomSet->rawTable.insert(keys[i].data(), keys[i].size(), data.forEntry(i),
                                            kDataSize);
                cursor.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
            }
            size = n;
        }
        return *gRandomSet;
    }
    // Kept without its size: randomSet still fills a set of its own on its
    // first call.
    static void keepRandomSet(std::unique_ptr<BlobPair> set, std::size_t /*n*/) {
        gRandomSet = std::move(set);
    }
    static void dropRandomSet() { gRandomSet.reset(); }
};

KeyPair& compositeSet(std::size_t n) {
    static std::size_t size = 0;
    if (gCompositeSet == nullptr || size != n) {
        gCompositeSet.reset();
        gCompositeSet = std::make_unique<KeyPair>(KovBtree::IndexTable);
        const std::vector<Key16>& keys = compositeKeys(n).keys;
        KovBtreeCursor cursor(gCompositeSet->table, true);
        for (const Key16& k : keys) {
            gCompositeSet->rawTable.insert(k.data(), k.size());
            cursor.insert(k.data(), k.size());
        }
        size = n;
    }
    return *gCompositeSet;
}

void BM_CompositeInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::vector<Key16>& keys = compositeKeys(n).keys;
    kov::bench::runPaired(state, StoreSide::kName, [&](PairedRun& run) {
        for (auto _ : state) {
            gCompositeSet.reset();
            auto set = std::make_unique<KeyPair>(KovBtree::IndexTable);
            {
                KovBtreeCursor cursor(set->table, true);
                const Key16& last = keys[n - 1];
                run.sides(
                    n, kov::bench::kInsertChunk,
                    kov::bench::endingWith(n, kov::bench::rawKeyInserts(set->rawTable, keys),
                                           [&] {
                                               kov::bench::requireReadable(
                                                   set->rawTable.readable(last.data(), last.size()),
                                                   kov::bench::kRawName);
                                           }),
                    kov::bench::endingWith(
                        n,
                        [&](std::size_t begin, std::size_t end) {
                            for (std::size_t i = begin; i < end; ++i) {
                                cursor.insert(keys[i].data(), keys[i].size());
                            }
                        },
                        [&] {
                            kov::bench::requireReadable(
                                kov::bench::storeReadable(cursor, last.data(), last.size()),
                                StoreSide::kName);
                        }));
            }
            gCompositeSet = std::move(set);
        }
    });
}

void BM_PrefixWalk(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const CompositeSet& c = compositeKeys(n);
    kov::bench::runPaired(state, StoreSide::kName, [&](PairedRun& run) {
        std::vector<unsigned char> rawPayload(64);
        std::string storePayload;
        KeyPair& set = compositeSet(n);
        KovBtreeCursor cursor(set.table, true);
        for (auto _ : state) {
            Tally raw;
            Tally store;
            run.sides(
                CompositeKeys::kGroups, kWalkChunk,
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t g = begin; g < end; ++g) {
                        const unsigned char* prefix = c.groups.walkPrefix(g);
                        set.rawTable.walkPrefix(
                            prefix, CompositeKeys::kPrefixSize,
                            [&](const unsigned char* payload, std::size_t size) {
                                if (size > rawPayload.size()) {
                                    throw std::runtime_error("raw walk: key larger than expected");
                                }
                                std::memcpy(rawPayload.data(), payload, size);
                                raw.add(prefix, size, rawPayload.data());
                            });
                    }
                },
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t g = begin; g < end; ++g) {
                        const unsigned char* prefix = c.groups.walkPrefix(g);
                        constexpr std::size_t kPrefix = CompositeKeys::kPrefixSize;
                        if (!cursor.indexKeySeek(prefix, kPrefix)) {
                            continue;
                        }
                        while (cursor.indexKeyFetch(prefix, kPrefix, storePayload)) {
                            store.add(prefix, storePayload.size(),
                                      reinterpret_cast<const unsigned char*>(storePayload.data()));
                            if (!cursor.next()) {
                                break;
                            }
                        }
                    }
                },
                c.distinct);
            kov::bench::checkTallies(raw, store, c.distinct,
                                     "walk: the two sides walked different entries");
        }
    });
}

}  // namespace

int main(int argc, char** argv) {
    std::int64_t n = 0;
    if (!kov::bench::initialize(&argc, argv, &n)) {
        return 1;
    }
    // The store first: it points SQLite at its temporary directory, so the
    // raw databases' files land in the same place.
    KovPager::instance();
    std::vector<kov::bench::PairedWorkload> workloads = kov::bench::sharedWorkloads<StoreSide>();
    workloads.push_back({"BM_CompositeInsert", BM_CompositeInsert, 2});
    workloads.push_back({"BM_PrefixWalk", BM_PrefixWalk, 5});
    kov::bench::runWorkloads(n, workloads);
    // Tables go before the store's exit-time teardown closes the engine.
    gRandomSet.reset();
    gCompositeSet.reset();
    return 0;
}
