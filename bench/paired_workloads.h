// The workloads the engine and store programs both run, written once over
// the measured side: the engine binding (engine_benchmark) or the store's
// public classes (store_benchmark). The other side is always raw SQLite
// (bench/raw_sqlite.h), and the two run paired (bench/bench_util.h).
//
//   BM_SeqIntInsert      N inserts of the integer keys 0..N-1 with 100-byte data
//   BM_RandomBlobInsert  N inserts of random 16-byte keys with 100-byte data
//   BM_OrderedScan       a full ordered walk of the N random-key entries, key and data read
//   BM_RandomSeek        N/10 seeks of existing random keys, data read
//
// Inserts start from an empty table every iteration; the scan and the seeks
// read the side's random set. A measured side S provides:
//
//   S::kName             its name in the counters (<kName>_ns)
//   S::IntSet            a raw integer-keyed table (member rawTable) and the
//                        side's own with a writing cursor (member cursor),
//                        made fresh; checkFilled(n) after the N inserts
//   S::BlobSet           a raw byte-keyed table (member rawTable) and the
//                        side's own
//   S::Cursor            a writing cursor on a BlobSet (or in an IntSet):
//                          insert(key, data, size)            integer key
//                          insert(key, keySize, data, size)   byte key
//                          step(started)       first() when not started, else
//                                              next(); false past the end
//                          readEntry(keyBuf, dataBuf, tally)  the entry's key
//                                              and data copied out, tallied
//                          seekEntry(key, buffer, tally)      the key sought; when
//                                              found with 8 data bytes or more, its
//                                              data copied out and tallied
//   S::newBlobSet()      a new, empty BlobSet
//   S::randomSet(n)      the BlobSet with the N workload keys the reads use
//   S::keepRandomSet(set, n), S::dropRandomSet()
//                        what the insert workload leaves for the reads
#ifndef KOVPAGER_BENCH_PAIRED_WORKLOADS_H
#define KOVPAGER_BENCH_PAIRED_WORKLOADS_H

#include <benchmark/benchmark.h>

#include <cstdint>
#include <memory>
#include <utility>
#include <vector>

#include "bench/bench_util.h"
#include "bench/raw_sqlite.h"

namespace kov::bench {

// Chunk sizes of the paired workloads, in operations, and the size of the
// buffers their reads copy into.
constexpr std::size_t kInsertChunk = 1000;
constexpr std::size_t kScanChunk = 4096;
constexpr std::size_t kSeekChunk = 256;
constexpr std::size_t kReadBufferSize = 4096;

template <class Side>
void seqIntInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    runPaired(state, Side::kName, [&](PairedRun& run) {
        Payload rawData;
        Payload measuredData;
        for (auto _ : state) {
            typename Side::IntSet set;
            run.sides(n, kInsertChunk, rawIntInserts(set.rawTable, rawData),
                      [&](std::size_t begin, std::size_t end) {
                          for (std::size_t i = begin; i < end; ++i) {
                              set.cursor.insert(static_cast<std::int64_t>(i),
                                                measuredData.forEntry(i), kDataSize);
                          }
                      });
            set.checkFilled(n);
        }
    });
}

template <class Side>
void randomBlobInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::vector<Key16>& keys = workloadKeys(n);
    runPaired(state, Side::kName, [&](PairedRun& run) {
        Payload rawData;
        Payload measuredData;
        for (auto _ : state) {
            // Drop the kept tables first: one 64 MiB cache less alive (and no
            // cursor is open, so the store really drops its table).
            Side::dropRandomSet();
            std::unique_ptr<typename Side::BlobSet> set = Side::newBlobSet();
            {
                typename Side::Cursor cursor(*set);
                run.sides(n, kInsertChunk, rawBlobInserts(set->rawTable, keys, rawData),
                          [&](std::size_t begin, std::size_t end) {
                              for (std::size_t i = begin; i < end; ++i) {
                                  cursor.insert(keys[i].data(), keys[i].size(),
                                                measuredData.forEntry(i), kDataSize);
                              }
                          });
            }
            Side::keepRandomSet(std::move(set), n);
        }
    });
}

template <class Side>
void orderedScan(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    runPaired(state, Side::kName, [&](PairedRun& run) {
        std::vector<unsigned char> keyBuf(kReadBufferSize);
        std::vector<unsigned char> dataBuf(kReadBufferSize);
        typename Side::BlobSet& set = Side::randomSet(n);
        typename Side::Cursor cursor(set);
        for (auto _ : state) {
            Tally raw;
            Tally measured;
            bool started = false;
            RawScan& scan = set.rawTable.scan();
            run.sides(n, kScanChunk, rawScanRows(scan, keyBuf, dataBuf, raw),
                      [&](std::size_t begin, std::size_t end) {
                          for (std::size_t i = begin; i < end; ++i) {
                              bool on = cursor.step(started);
                              started = true;
                              if (!on) {
                                  break;
                              }
                              cursor.readEntry(keyBuf, dataBuf, measured);
                          }
                      });
            scan.reset();
            checkTallies(raw, measured, n, "scan: the two sides read different entries");
        }
    });
}

template <class Side>
void randomSeek(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    const std::size_t seeks = n / 10;
    const std::vector<Key16>& keys = workloadKeys(n);
    const std::vector<std::size_t> order = randomIndices(seeks, n, kSeekSeed);
    runPaired(state, Side::kName, [&](PairedRun& run) {
        std::vector<unsigned char> rawBuf(kReadBufferSize);
        std::vector<unsigned char> measuredBuf(kReadBufferSize);
        typename Side::BlobSet& set = Side::randomSet(n);
        typename Side::Cursor cursor(set);
        for (auto _ : state) {
            Tally raw;
            Tally measured;
            run.sides(seeks, kSeekChunk, rawSeeks(set.rawTable, keys, order, rawBuf, raw),
                      [&](std::size_t begin, std::size_t end) {
                          for (std::size_t i = begin; i < end; ++i) {
                              cursor.seekEntry(keys[order[i]], measuredBuf, measured);
                          }
                      });
            checkTallies(raw, measured, seeks, "seek: the two sides found different entries");
        }
    });
}

// The four workloads on side S, with their iteration counts.
template <class Side>
std::vector<PairedWorkload> sharedWorkloads() {
    return {
        {"BM_SeqIntInsert", seqIntInsert<Side>, 3},
        {"BM_RandomBlobInsert", randomBlobInsert<Side>, 2},
        {"BM_OrderedScan", orderedScan<Side>, 5},
        {"BM_RandomSeek", randomSeek<Side>, 5},
    };
}

}  // namespace kov::bench

#endif  // KOVPAGER_BENCH_PAIRED_WORKLOADS_H
