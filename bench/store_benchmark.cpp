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
//   BM_CompositeInsert   N key-only inserts, random order, of 16-byte composite keys: an
//                        8-byte prefix naming one of 1 000 groups, then an 8-byte payload
//   BM_PrefixWalk        every group walked by its prefix, payload read (ns per entry)
// Inserts start from an empty table every iteration. Counters: store_ns and
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
#include "bench/raw_sqlite.h"

namespace {

using kov::bench::kDataSize;
using kov::bench::Key16;
using kov::bench::PairTimer;
using kov::bench::Payload;
using kov::bench::RawBlobTable;
using kov::bench::RawDatabase;
using kov::bench::RawIntTable;
using kov::bench::RawKeyTable;
using kov::bench::Tally;

constexpr std::size_t kInsertChunk = 1000;
constexpr std::size_t kScanChunk = 4096;
constexpr std::size_t kSeekChunk = 256;
constexpr std::size_t kGroups = 1000;
constexpr std::size_t kPrefixSize = 8;
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

// The N random keys; entry i of every table is keys[i] with Payload entry i.
const std::vector<Key16>& workloadKeys(std::size_t n) {
    static std::vector<Key16> keys;
    if (keys.size() != n) {
        keys = kov::bench::randomKeys(n, 0x6b6f76);
    }
    return keys;
}

// The N composite keys, in insertion order: the prefix of a random group,
// then a random payload.
struct CompositeKeys {
    std::vector<Key16> prefixes;    // kGroups group prefixes (first 8 bytes used)
    std::vector<Key16> keys;        // N keys
    std::vector<std::size_t> walk;  // the order in which groups are walked
    std::size_t distinct = 0;       // distinct keys among `keys`
};
const CompositeKeys& compositeKeys(std::size_t n) {
    static CompositeKeys c;
    if (c.keys.size() != n) {
        c.prefixes = kov::bench::randomKeys(kGroups, 0x67726f7570);
        kov::bench::Random random(0x7061796c6f6164);
        c.keys.resize(n);
        for (Key16& k : c.keys) {
            const Key16& prefix = c.prefixes[random.below(kGroups)];
            std::memcpy(k.data(), prefix.data(), kPrefixSize);
            kov::bench::putBigEndian(k.data() + kPrefixSize, random.next());
        }
        c.walk.resize(kGroups);
        for (std::size_t i = 0; i < kGroups; ++i) {
            c.walk[i] = i;
        }
        for (std::size_t i = kGroups - 1; i > 0; --i) {
            std::swap(c.walk[i], c.walk[random.below(i + 1)]);
        }
        std::vector<Key16> sorted = c.keys;
        std::sort(sorted.begin(), sorted.end());
        c.distinct =
            static_cast<std::size_t>(std::unique(sorted.begin(), sorted.end()) - sorted.begin());
    }
    return c;
}

// The filled tables the read workloads use: the last ones the insert
// workload filled, or filled on first use when it did not run.
std::unique_ptr<BlobPair> gRandomSet;
std::unique_ptr<KeyPair> gCompositeSet;

void fillRandom(BlobPair& set, std::size_t n) {
    const std::vector<Key16>& keys = workloadKeys(n);
    Payload data;
    KovBtreeCursor cursor(set.table, true);
    for (std::size_t i = 0; i < n; ++i) {
        set.rawTable.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
        cursor.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
    }
}

BlobPair& randomSet(std::size_t n) {
    static std::size_t size = 0;
    if (gRandomSet == nullptr || size != n) {
        gRandomSet.reset();
        gRandomSet = std::make_unique<BlobPair>(KovBtree::BlobTable);
        fillRandom(*gRandomSet, n);
        size = n;
    }
    return *gRandomSet;
}

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

void BM_SeqIntInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    PairTimer timer;
    Payload rawData;
    Payload storeData;
    try {
        for (auto _ : state) {
            TablePair<RawIntTable> set(KovBtree::IntKeyTable);
            KovBtreeCursor cursor(set.table, true);
            timer.run(
                n, kInsertChunk,
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        set.rawTable.insert(static_cast<std::int64_t>(i), rawData.forEntry(i),
                                            kDataSize);
                    }
                },
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        cursor.insert(static_cast<std::int64_t>(i), storeData.forEntry(i),
                                      kDataSize);
                    }
                });
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            // A cheap check that the store took every entry.
            std::int64_t lastKey = -1;
            if (cursor.last()) {
                cursor.key(lastKey);
            }
            if (lastKey != static_cast<std::int64_t>(n - 1)) {
                throw std::runtime_error("store: the last inserted key is missing");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

void BM_RandomBlobInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::vector<Key16>& keys = workloadKeys(n);
    PairTimer timer;
    Payload rawData;
    Payload storeData;
    try {
        for (auto _ : state) {
            // Drop the kept tables first (no cursor is open, so the store
            // really drops its table).
            gRandomSet.reset();
            auto set = std::make_unique<BlobPair>(KovBtree::BlobTable);
            {
                KovBtreeCursor cursor(set->table, true);
                timer.run(
                    n, kInsertChunk,
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            set->rawTable.insert(keys[i].data(), keys[i].size(),
                                                 rawData.forEntry(i), kDataSize);
                        }
                    },
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            cursor.insert(keys[i].data(), keys[i].size(), storeData.forEntry(i),
                                          kDataSize);
                        }
                    });
            }
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            gRandomSet = std::move(set);
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

void BM_OrderedScan(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    PairTimer timer;
    std::vector<unsigned char> keyBuf(4096);
    std::vector<unsigned char> dataBuf(4096);
    std::string storeKey;
    try {
        BlobPair& set = randomSet(n);
        KovBtreeCursor cursor(set.table, true);
        for (auto _ : state) {
            Tally raw;
            Tally store;
            bool storeStarted = false;
            kov::bench::RawScan& scan = set.rawTable.scan();
            timer.run(
                n, kScanChunk,
                [&](std::size_t begin, std::size_t end) {
                    scan.copyRows(end - begin, keyBuf, dataBuf,
                                  [&](const unsigned char* key, std::size_t keySize,
                                      const unsigned char* data) { raw.add(key, keySize, data); });
                },
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        bool on = storeStarted ? cursor.next() : cursor.first();
                        storeStarted = true;
                        if (!on) {
                            break;
                        }
                        // The whole key: the public fetch with an empty prefix.
                        cursor.indexKeyFetch("", 0, storeKey);
                        auto dataSize = static_cast<std::uint64_t>(cursor.dataSize());
                        if (dataSize > dataBuf.size()) {
                            throw std::runtime_error("store scan: entry larger than expected");
                        }
                        cursor.data(dataBuf.data(), dataSize);
                        store.add(reinterpret_cast<const unsigned char*>(storeKey.data()),
                                  storeKey.size(), dataBuf.data());
                    }
                });
            scan.reset();
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            if (raw.rows != n || !(raw == store)) {
                throw std::runtime_error("scan: the two sides read different entries");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

void BM_RandomSeek(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::size_t seeks = n / 10;
    const std::vector<Key16>& keys = workloadKeys(n);
    const std::vector<std::size_t> order = kov::bench::randomIndices(seeks, n, 0x7365656b);
    PairTimer timer;
    std::vector<unsigned char> rawBuf(4096);
    std::vector<unsigned char> storeBuf(4096);
    try {
        BlobPair& set = randomSet(n);
        KovBtreeCursor cursor(set.table, true);
        for (auto _ : state) {
            Tally raw;
            Tally store;
            timer.run(
                seeks, kSeekChunk,
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        const Key16& key = keys[order[i]];
                        if (set.rawTable.seekData(key.data(), key.size(), rawBuf.data(),
                                                  rawBuf.size()) >= 8) {
                            raw.add(key.data(), key.size(), rawBuf.data());
                        }
                    }
                },
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        const Key16& key = keys[order[i]];
                        if (cursor.seek(key.data(), key.size()) != 0) {
                            continue;
                        }
                        auto dataSize = static_cast<std::uint64_t>(cursor.dataSize());
                        if (dataSize < 8 || dataSize > storeBuf.size()) {
                            continue;
                        }
                        cursor.data(storeBuf.data(), dataSize);
                        store.add(key.data(), key.size(), storeBuf.data());
                    }
                });
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            if (raw.rows != seeks || !(raw == store)) {
                throw std::runtime_error("seek: the two sides found different entries");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

void BM_CompositeInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::vector<Key16>& keys = compositeKeys(n).keys;
    PairTimer timer;
    try {
        for (auto _ : state) {
            gCompositeSet.reset();
            auto set = std::make_unique<KeyPair>(KovBtree::IndexTable);
            {
                KovBtreeCursor cursor(set->table, true);
                timer.run(
                    n, kInsertChunk,
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            set->rawTable.insert(keys[i].data(), keys[i].size());
                        }
                    },
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            cursor.insert(keys[i].data(), keys[i].size());
                        }
                    });
            }
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            gCompositeSet = std::move(set);
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

void BM_PrefixWalk(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const CompositeKeys& c = compositeKeys(n);
    PairTimer timer;
    std::vector<unsigned char> rawPayload(64);
    std::string storePayload;
    try {
        KeyPair& set = compositeSet(n);
        KovBtreeCursor cursor(set.table, true);
        for (auto _ : state) {
            Tally raw;
            Tally store;
            timer.run(
                kGroups, kWalkChunk,
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t g = begin; g < end; ++g) {
                        const unsigned char* prefix = c.prefixes[c.walk[g]].data();
                        set.rawTable.walkPrefix(
                            prefix, kPrefixSize,
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
                        const unsigned char* prefix = c.prefixes[c.walk[g]].data();
                        if (!cursor.indexKeySeek(prefix, kPrefixSize)) {
                            continue;
                        }
                        while (cursor.indexKeyFetch(prefix, kPrefixSize, storePayload)) {
                            store.add(prefix, storePayload.size(),
                                      reinterpret_cast<const unsigned char*>(storePayload.data()));
                            if (!cursor.next()) {
                                break;
                            }
                        }
                    }
                },
                c.distinct);
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            if (raw.rows != c.distinct || !(raw == store)) {
                throw std::runtime_error("walk: the two sides walked different entries");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "store");
}

}  // namespace

int main(int argc, char** argv) {
    const std::int64_t n = kov::bench::takeWorkloadSize(&argc, argv);
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    // The store first: it points SQLite at its temporary directory, so the
    // raw databases' files land in the same place.
    KovPager::instance();
    const struct {
        const char* name;
        void (*fn)(benchmark::State&);
        int iterations;
    } workloads[] = {
        {"BM_SeqIntInsert", BM_SeqIntInsert, 3},
        {"BM_RandomBlobInsert", BM_RandomBlobInsert, 2},
        {"BM_OrderedScan", BM_OrderedScan, 5},
        {"BM_RandomSeek", BM_RandomSeek, 5},
        {"BM_CompositeInsert", BM_CompositeInsert, 2},
        {"BM_PrefixWalk", BM_PrefixWalk, 5},
    };
    for (const auto& w : workloads) {
        benchmark::RegisterBenchmark(w.name, w.fn)
            ->Arg(n)
            ->Iterations(w.iterations)
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
    // Tables go before the store's exit-time teardown closes the engine.
    gRandomSet.reset();
    gCompositeSet.reset();
    return 0;
}
