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
// Inserts start from an empty table in a fresh database every iteration.
// Counters: bind_ns and raw_ns, processor nanoseconds per operation; ratio =
// bind / raw on processor time, wall_ratio the same on elapsed time. The Time
// column is the binding's elapsed time per iteration.

// The binding's header first: its result codes share <sqlite3.h>'s macro
// names.
#include "engine/btree.h"

#include <benchmark/benchmark.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/bench_util.h"
#include "bench/raw_sqlite.h"

namespace {

namespace eng = kov::engine;
using kov::bench::kDataSize;
using kov::bench::Key16;
using kov::bench::PairTimer;
using kov::bench::Payload;
using kov::bench::RawBlobTable;
using kov::bench::RawDatabase;
using kov::bench::RawIntTable;
using kov::bench::Tally;

constexpr std::size_t kInsertChunk = 1000;
constexpr std::size_t kScanChunk = 4096;
constexpr std::size_t kSeekChunk = 256;
constexpr int kIntKeyFlags = eng::BTREE_INTKEY | eng::BTREE_LEAFDATA;
constexpr int kBlobFlags = 0;

void check(int rc, const char* what) {
    if (rc != SQLITE_OK) {
        throw std::runtime_error(std::string("engine ") + what + ": result " + std::to_string(rc));
    }
}

// One engine handle, set up as the pager sets it up.
class Engine {
  public:
    Engine() {
        check(eng::sqlite3BtreeOpen(nullptr, nullptr, &p_, 3), "open");
        check(eng::sqlite3BtreeSetPageSize(p_, 4096, -1), "page size");
        check(eng::sqlite3BtreeSetCacheSize(p_, 16384), "cache size");
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

// A writing cursor, closed on destruction.
class Cursor {
  public:
    Cursor(Engine& engine, std::uint32_t root) {
        check(eng::sqlite3BtreeCursor(engine.get(), root, 1, nullptr, nullptr, &c_), "cursor");
    }
    ~Cursor() { eng::sqlite3BtreeCloseCursor(c_); }
    Cursor(const Cursor&) = delete;
    Cursor& operator=(const Cursor&) = delete;
    eng::BtCursor* get() const { return c_; }

  private:
    eng::BtCursor* c_ = nullptr;
};

// A raw byte-keyed table and an engine byte-keyed table side by side.
struct BlobPair {
    RawDatabase rawDb;
    RawBlobTable rawTable{rawDb};
    Engine engine;
    std::uint32_t root = engine.createTable(kBlobFlags);
};

// The N random keys; entry i of every table is keys[i] with Payload entry i.
const std::vector<Key16>& workloadKeys(std::size_t n) {
    static std::vector<Key16> keys;
    if (keys.size() != n) {
        keys = kov::bench::randomKeys(n, 0x6b6f76);
    }
    return keys;
}

// The filled random-key tables that the scan and seek workloads read: the
// last ones BM_RandomBlobInsert filled, or filled here when it did not run.
std::unique_ptr<BlobPair> gRandomSet;
std::size_t gRandomSetSize = 0;

BlobPair& randomSet(std::size_t n) {
    if (gRandomSet == nullptr || gRandomSetSize != n) {
        gRandomSet.reset();
        auto set = std::make_unique<BlobPair>();
        const std::vector<Key16>& keys = workloadKeys(n);
        Payload data;
        Cursor cursor(set->engine, set->root);
        for (std::size_t i = 0; i < n; ++i) {
            set->rawTable.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
            check(eng::sqlite3BtreeInsert(cursor.get(), keys[i].data(), keys[i].size(),
                                          data.forEntry(i), kDataSize),
                  "insert");
        }
        gRandomSet = std::move(set);
        gRandomSetSize = n;
    }
    return *gRandomSet;
}

void BM_SeqIntInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    PairTimer timer;
    Payload rawData;
    Payload bindData;
    try {
        for (auto _ : state) {
            RawDatabase rawDb;
            RawIntTable rawTable(rawDb);
            Engine engine;
            Cursor cursor(engine, engine.createTable(kIntKeyFlags));
            timer.run(
                n, kInsertChunk,
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        rawTable.insert(static_cast<std::int64_t>(i), rawData.forEntry(i),
                                        kDataSize);
                    }
                },
                [&](std::size_t begin, std::size_t end) {
                    for (std::size_t i = begin; i < end; ++i) {
                        check(eng::sqlite3BtreeInsert(cursor.get(), nullptr,
                                                      static_cast<std::int64_t>(i),
                                                      bindData.forEntry(i), kDataSize),
                              "insert");
                    }
                });
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "bind");
}

void BM_RandomBlobInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::vector<Key16>& keys = workloadKeys(n);
    PairTimer timer;
    Payload rawData;
    Payload bindData;
    try {
        for (auto _ : state) {
            // Drop the kept tables first: one less 64 MiB cache alive.
            gRandomSet.reset();
            auto set = std::make_unique<BlobPair>();
            {
                Cursor cursor(set->engine, set->root);
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
                            check(eng::sqlite3BtreeInsert(cursor.get(), keys[i].data(),
                                                          keys[i].size(), bindData.forEntry(i),
                                                          kDataSize),
                                  "insert");
                        }
                    });
            }
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            gRandomSet = std::move(set);
            gRandomSetSize = n;
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "bind");
}

void BM_OrderedScan(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    PairTimer timer;
    std::vector<unsigned char> keyBuf(4096);
    std::vector<unsigned char> dataBuf(4096);
    try {
        BlobPair& set = randomSet(n);
        Cursor cursor(set.engine, set.root);
        for (auto _ : state) {
            Tally raw;
            Tally bind;
            bool bindStarted = false;
            kov::bench::RawScan& scan = set.rawTable.scan();
            timer.run(
                n, kScanChunk,
                [&](std::size_t begin, std::size_t end) {
                    scan.copyRows(end - begin, keyBuf, dataBuf,
                                  [&](const unsigned char* key, std::size_t keySize,
                                      const unsigned char* data) { raw.add(key, keySize, data); });
                },
                [&](std::size_t begin, std::size_t end) {
                    eng::BtCursor* c = cursor.get();
                    for (std::size_t i = begin; i < end; ++i) {
                        int atEnd = 1;
                        check(bindStarted ? eng::sqlite3BtreeNext(c, &atEnd)
                                          : eng::sqlite3BtreeFirst(c, &atEnd),
                              "step");
                        bindStarted = true;
                        if (atEnd != 0) {
                            break;
                        }
                        std::int64_t keySize = 0;
                        std::uint32_t dataSize = 0;
                        check(eng::sqlite3BtreeKeySize(c, &keySize), "key size");
                        check(eng::sqlite3BtreeDataSize(c, &dataSize), "data size");
                        if (static_cast<std::uint64_t>(keySize) > keyBuf.size() ||
                            dataSize > dataBuf.size()) {
                            throw std::runtime_error("engine scan: entry larger than expected");
                        }
                        check(eng::sqlite3BtreeKey(c, 0, static_cast<std::uint32_t>(keySize),
                                                   keyBuf.data()),
                              "key");
                        check(eng::sqlite3BtreeData(c, 0, dataSize, dataBuf.data()), "data");
                        bind.add(keyBuf.data(), static_cast<std::size_t>(keySize), dataBuf.data());
                    }
                });
            scan.reset();
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            if (raw.rows != n || bind.rows != n || raw.sum != bind.sum) {
                throw std::runtime_error("scan: the two sides read different entries");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "bind");
}

void BM_RandomSeek(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::size_t seeks = n / 10;
    const std::vector<Key16>& keys = workloadKeys(n);
    const std::vector<std::size_t> order = kov::bench::randomIndices(seeks, n, 0x7365656b);
    PairTimer timer;
    std::vector<unsigned char> rawBuf(4096);
    std::vector<unsigned char> bindBuf(4096);
    try {
        BlobPair& set = randomSet(n);
        Cursor cursor(set.engine, set.root);
        for (auto _ : state) {
            Tally raw;
            Tally bind;
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
                    eng::BtCursor* c = cursor.get();
                    for (std::size_t i = begin; i < end; ++i) {
                        const Key16& key = keys[order[i]];
                        int cmp = -1;
                        check(eng::sqlite3BtreeMoveto(c, key.data(), key.size(), &cmp), "seek");
                        if (cmp != 0) {
                            continue;
                        }
                        std::uint32_t dataSize = 0;
                        check(eng::sqlite3BtreeDataSize(c, &dataSize), "data size");
                        if (dataSize < 8 || dataSize > bindBuf.size()) {
                            continue;
                        }
                        check(eng::sqlite3BtreeData(c, 0, dataSize, bindBuf.data()), "data");
                        bind.add(key.data(), key.size(), bindBuf.data());
                    }
                });
            state.SetIterationTime(timer.takeMeasuredWallSeconds());
            if (raw.rows != seeks || bind.rows != seeks || raw.sum != bind.sum) {
                throw std::runtime_error("seek: the two sides found different entries");
            }
        }
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    kov::bench::setPairCounters(state, timer, "bind");
}

}  // namespace

int main(int argc, char** argv) {
    const std::int64_t n = kov::bench::takeWorkloadSize(&argc, argv);
    benchmark::Initialize(&argc, argv);
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
        return 1;
    }
    const struct {
        const char* name;
        void (*fn)(benchmark::State&);
        int iterations;
    } workloads[] = {
        {"BM_SeqIntInsert", BM_SeqIntInsert, 3},
        {"BM_RandomBlobInsert", BM_RandomBlobInsert, 2},
        {"BM_OrderedScan", BM_OrderedScan, 5},
        {"BM_RandomSeek", BM_RandomSeek, 5},
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
    gRandomSet.reset();
    return 0;
}
