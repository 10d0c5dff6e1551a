// The workloads the engine and store programs both run, written once over
// the measured side: the engine binding (engine_benchmark) or the store's
// public classes (store_benchmark). The other side is always raw SQLite
// (bench/raw_sqlite.h), and the two run paired (bench/bench_util.h).
//
//   BM_SeqIntInsert      N inserts of the integer keys 0..N-1 with 100-byte data
//   BM_RandomBlobInsert  N inserts of random 16-byte keys with 100-byte data
//   BM_OrderedScan       a full ordered walk of the N random-key entries, key and data read
//   BM_RandomSeek        N/10 seeks of existing random keys, data read
//   BM_CountDraws        read-modify-write counting: N draws of 16-byte keys from
//                        a skewed law (bench_util.h, SkewedDraws), each counted
//                        once more (raw: one upsert; measured: a seek, the 8-byte
//                        count read when found, an insert of count + 1), then one
//                        walk of the counts in key order (ns per draw)
//
// Inserts start from an empty table every iteration, and each side's last
// chunk ends, inside its timing, with the entries read back: the first entry
// and the last key inserted (bench_util.h, requireReadable). The scan and the
// seeks read the side's random set. A measured side S provides:
//
//   S::kName             its name in the counters (<kName>_ns)
//   S::IntSet            a raw integer-keyed table (member rawTable) and the
//                        side's own with a writing cursor (member cursor),
//                        made fresh; checkFilled(n) after the N inserts
//   S::BlobSet           a raw byte-keyed table (member rawTable) and the
//                        side's own
//   S::CountSet          a raw count table (member rawTable) and the side's own
//                        byte-keyed table, made fresh
//   S::Cursor            a writing cursor on a BlobSet or a CountSet (or in an
//                        IntSet):
//                          insert(key, data, size)            integer key
//                          insert(key, keySize, data, size)   byte key
//                          increment(key)      the key's 8-byte count read when
//                                              there, count + 1 (or 1) inserted
//                          readable(key) / readable(key, keySize)  first() on an
//                                              entry and the key found
//                          step(started)       first() when not started, else
//                                              next(); false past the end
//                          readEntry(keyBuf, dataBuf, tally)  the entry's key
//                                              and data copied out, tallied
//                          readCount(keyBuf, tally)  the entry's key and 8-byte
//                                              count copied out, the count tallied
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
#include <stdexcept>
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

// The raw side's name in a failed read back.
constexpr char kRawName[] = "raw SQLite";

template <class Side>
void seqIntInsert(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    runPaired(state, Side::kName, [&](PairedRun& run) {
        Payload rawData;
        Payload measuredData;
        const auto lastKey = static_cast<std::int64_t>(n - 1);
        for (auto _ : state) {
            typename Side::IntSet set;
            run.sides(
                n, kInsertChunk,
                endingWith(n, rawIntInserts(set.rawTable, rawData),
                           [&] { requireReadable(set.rawTable.readable(lastKey), kRawName); }),
                endingWith(
                    n,
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            set.cursor.insert(static_cast<std::int64_t>(i),
                                              measuredData.forEntry(i), kDataSize);
                        }
                    },
                    [&] { requireReadable(set.cursor.readable(lastKey), Side::kName); }));
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
                const Key16& last = keys[n - 1];
                run.sides(
                    n, kInsertChunk,
                    endingWith(n, rawBlobInserts(set->rawTable, keys, rawData),
                               [&] {
                                   requireReadable(set->rawTable.readable(last.data(), last.size()),
                                                   kRawName);
                               }),
                    endingWith(
                        n,
                        [&](std::size_t begin, std::size_t end) {
                            for (std::size_t i = begin; i < end; ++i) {
                                cursor.insert(keys[i].data(), keys[i].size(),
                                              measuredData.forEntry(i), kDataSize);
                            }
                        },
                        [&] {
                            requireReadable(cursor.readable(last.data(), last.size()), Side::kName);
                        }));
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

template <class Side>
void countDraws(benchmark::State& state) {
    const auto n = static_cast<std::size_t>(state.range(0));
    std::vector<Key16> keys(n);
    SkewedDraws draws(n);
    for (std::size_t i = 0; i < n; ++i) {
        keys[i] = draws.at(i);
    }
    const std::size_t distinct = distinctKeys(keys);
    const Key16& last = keys[n - 1];
    runPaired(state, Side::kName, [&](PairedRun& run) {
        std::vector<unsigned char> rawKey(kReadBufferSize);
        std::vector<unsigned char> measuredKey(kReadBufferSize);
        for (auto _ : state) {
            typename Side::CountSet set;
            typename Side::Cursor cursor(set);
            Tally raw;
            Tally measured;
            run.sides(
                n, kInsertChunk,
                endingWith(
                    n, rawCountDraws(set.rawTable, keys),
                    [&] {
                        requireReadable(set.rawTable.readable(last.data(), last.size()), kRawName);
                        set.rawTable.walk(rawKey,
                                          [&](const unsigned char* /*key*/, std::size_t /*keySize*/,
                                              std::uint64_t count) { raw.addCount(count); });
                    }),
                endingWith(
                    n,
                    [&](std::size_t begin, std::size_t end) {
                        for (std::size_t i = begin; i < end; ++i) {
                            cursor.increment(keys[i]);
                        }
                    },
                    [&] {
                        requireReadable(cursor.readable(last.data(), last.size()), Side::kName);
                        for (bool on = cursor.step(false); on; on = cursor.step(true)) {
                            cursor.readCount(measuredKey, measured);
                        }
                    }));
            checkTallies(raw, measured, distinct, "count: the two sides counted different keys");
            if (raw.sum != n) {
                throw std::runtime_error("count: the counts do not add up to N");
            }
        }
    });
}

// The five workloads on side S, with their iteration counts.
template <class Side>
std::vector<PairedWorkload> sharedWorkloads() {
    return {
        {"BM_SeqIntInsert", seqIntInsert<Side>, 3},
        {"BM_RandomBlobInsert", randomBlobInsert<Side>, 2},
        {"BM_OrderedScan", orderedScan<Side>, 5},
        {"BM_RandomSeek", randomSeek<Side>, 5},
        {"BM_CountDraws", countDraws<Side>, 2},
    };
}

}  // namespace kov::bench

#endif  // KOVPAGER_BENCH_PAIRED_WORKLOADS_H
