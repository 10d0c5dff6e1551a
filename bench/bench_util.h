// Shared helpers of the benchmark programs: the workload size, the
// reproducible key material, and the paired timer that runs a measured side
// and the raw baseline alternately in the same process.
//
// Workload size N: 1 000 000 by default; the command-line flag
// --kov_bench_n=N (taken out before Google Benchmark sees the arguments) or
// the environment variable KOV_BENCH_N sets it, the flag winning. Random
// seeks use N / 10 lookups.
//
// Pairing. PairTimer::run splits a workload of `count` operations into
// chunks and runs the two sides chunk by chunk, alternating which side goes
// first, so both see the same machine (other processes, the kernel's page
// cache, CPU frequency) at nearly the same moment. Each side's time is the
// sum of its own chunks, on the processor clock and on the wall clock;
// setPairCounters reports per-operation times and the measured/raw ratio as
// counters of the same benchmark run.
//
// A paired benchmark is written inside runPaired, which gives it a
// PairedRun (the timer with the benchmark's state) and turns a failure into
// a skipped benchmark:
//
//     void BM_X(benchmark::State& state) {
//         runPaired(state, "store", [&](PairedRun& run) {
//             ...tables...
//             for (auto _ : state) {
//                 run.sides(n, chunk, rawSide, measuredSide);
//             }
//         });
//     }
//
// and main is initialize, then runWorkloads with the program's list.
#ifndef KOVPAGER_BENCH_BENCH_UTIL_H
#define KOVPAGER_BENCH_BENCH_UTIL_H

#include <benchmark/benchmark.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace kov::bench {

// Removes --kov_bench_n=N from the arguments and returns the workload size.
inline std::int64_t takeWorkloadSize(int* argc, char** argv) {
    std::int64_t n = 1000000;
    if (const char* env = std::getenv("KOV_BENCH_N"); env != nullptr && *env != '\0') {
        n = std::strtoll(env, nullptr, 10);
    }
    static constexpr char kFlag[] = "--kov_bench_n=";
    int kept = 1;
    for (int i = 1; i < *argc; ++i) {
        if (std::strncmp(argv[i], kFlag, sizeof kFlag - 1) == 0) {
            n = std::strtoll(argv[i] + sizeof kFlag - 1, nullptr, 10);
        } else {
            argv[kept++] = argv[i];
        }
    }
    *argc = kept;
    return std::max<std::int64_t>(n, 1000);
}

constexpr std::uint64_t kGolden = 0x9E3779B97F4A7C15ULL;

// The SplitMix64 output for a given state: Random's k-th draw (k from 1) is
// mix(seed + k * kGolden), so a draw can also be computed without the ones
// before it.
inline std::uint64_t mix(std::uint64_t z) {
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ULL;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBULL;
    return z ^ (z >> 31);
}

// SplitMix64: a small, fast, reproducible generator.
class Random {
  public:
    explicit Random(std::uint64_t seed) : state_(seed) {}
    std::uint64_t next() { return mix(state_ += kGolden); }
    std::size_t below(std::size_t bound) { return static_cast<std::size_t>(next() % bound); }

  private:
    std::uint64_t state_;
};

using Key16 = std::array<unsigned char, 16>;

// Stores v big-endian, so byte order and numeric order agree.
inline void putBigEndian(unsigned char* out, std::uint64_t v) {
    for (int i = 7; i >= 0; --i) {
        out[i] = static_cast<unsigned char>(v);
        v >>= 8;
    }
}

// The i-th (from 0) of the random 16-byte keys of a seed: the generator's
// draws 2i+1 and 2i+2, big-endian, made without the draws before them.
inline Key16 keyAt(std::uint64_t seed, std::uint64_t i) {
    Key16 k;
    putBigEndian(k.data(), mix(seed + (2 * i + 1) * kGolden));
    putBigEndian(k.data() + 8, mix(seed + (2 * i + 2) * kGolden));
    return k;
}

// n random 16-byte keys, the same for every run: keyAt(seed, 0..n-1).
inline std::vector<Key16> randomKeys(std::size_t n, std::uint64_t seed) {
    std::vector<Key16> keys(n);
    for (std::size_t i = 0; i < n; ++i) {
        keys[i] = keyAt(seed, i);
    }
    return keys;
}

// How many different keys `keys` holds.
inline std::size_t distinctKeys(std::vector<Key16> keys) {
    std::sort(keys.begin(), keys.end());
    return static_cast<std::size_t>(std::unique(keys.begin(), keys.end()) - keys.begin());
}

// count indices drawn from [0, bound), the same for every run.
inline std::vector<std::size_t> randomIndices(std::size_t count, std::size_t bound,
                                              std::uint64_t seed) {
    Random random(seed);
    std::vector<std::size_t> out(count);
    for (std::size_t& i : out) {
        i = random.below(bound);
    }
    return out;
}

// Seeds of the workloads' key material, one set for every program, so that
// all of them insert, seek and walk the same keys.
constexpr std::uint64_t kWorkloadKeySeed = 0x6b6f76;      // the N random 16-byte keys
constexpr std::uint64_t kSeekSeed = 0x7365656b;           // which of them the seeks look for
constexpr std::uint64_t kGroupPrefixSeed = 0x67726f7570;  // the composite keys' group prefixes
constexpr std::uint64_t kPayloadSeed = 0x7061796c6f6164;  // their groups and payloads
constexpr std::uint64_t kDrawSeed = 0x64726177;           // the counting workload's draws
constexpr std::uint64_t kCountKeySeed = 0x636f756e74;     // and the keys they name

// The N random keys of the workloads, made on first use and kept; entry i
// of every table is keys[i] with Payload entry i.
inline const std::vector<Key16>& workloadKeys(std::size_t n) {
    static std::vector<Key16> keys;
    if (keys.size() != n) {
        keys = randomKeys(n, kWorkloadKeySeed);
    }
    return keys;
}

// Composite keys of 16 bytes: an 8-byte group prefix (one of 1 000) followed
// by an 8-byte random payload, made one at a time in insertion order; and the
// order in which the groups are walked.
class CompositeKeys {
  public:
    static constexpr std::size_t kGroups = 1000;
    static constexpr std::size_t kPrefixSize = 8;

    CompositeKeys()
        : prefixes_(randomKeys(kGroups, kGroupPrefixSeed)), random_(kPayloadSeed) {
        walk_.resize(kGroups);
        for (std::size_t i = 0; i < kGroups; ++i) {
            walk_[i] = i;
        }
        Random order(0x77616c6b);
        for (std::size_t i = kGroups - 1; i > 0; --i) {
            std::swap(walk_[i], walk_[order.below(i + 1)]);
        }
    }
    // The next key of the insertion sequence.
    Key16 next() {
        Key16 k;
        std::memcpy(k.data(), prefixes_[random_.below(kGroups)].data(), kPrefixSize);
        putBigEndian(k.data() + kPrefixSize, random_.next());
        return k;
    }
    // The prefix of the g-th group in walk order (its first kPrefixSize bytes).
    const unsigned char* walkPrefix(std::size_t g) const { return prefixes_[walk_[g]].data(); }

  private:
    std::vector<Key16> prefixes_;
    std::vector<std::size_t> walk_;
    Random random_;
};

// The draws of the counting workload (W7, BM_CountDraws): N draws of
// 16-byte keys from a skewed law over N distinct keys, a few drawn very often
// and most rarely, each computed on its own from its index.
//
// Draw i (from 0) takes u, uniform in [0, 1), from the generator's draw i+1
// of kDrawSeed, and the rank r = floor((N + 1)^u) - 1, in [0, N); its key is
// keyAt(kCountKeySeed, r), so the hot keys lie anywhere in the key order. A
// rank comes up with probability P(r) = ln((r + 2) / (r + 1)) / ln(N + 1),
// about 1 / ((r + 1) ln N): Zipf's law with exponent 1. The hottest key takes
// ln 2 / ln(N + 1) of the draws (6 % at N = 100 000, 5 % at 1 M), the ten
// hottest ln 11 / ln(N + 1) (21 %, 17 %). The expected number of distinct
// keys drawn, the sum over r of 1 - (1 - P(r))^N, is close to
// (N / ln N)(1 + ln ln N - 0.577):
//
//     N        20 k    100 k   1 M     4 M     10 M
//     keys     5.6 k   25 k    223 k   836 k   2.0 M   (about a fifth to a quarter of N)
class SkewedDraws {
  public:
    explicit SkewedDraws(std::uint64_t n) : n_(n), logSpan_(std::log(static_cast<double>(n) + 1)) {}
    std::uint64_t size() const { return n_; }
    std::uint64_t rank(std::uint64_t i) const {
        double u = static_cast<double>(mix(kDrawSeed + (i + 1) * kGolden) >> 11) * 0x1.0p-53;
        auto r = static_cast<std::uint64_t>(std::floor(std::exp(u * logSpan_))) - 1;
        return r < n_ ? r : n_ - 1;  // (N + 1)^u may round up to N + 1
    }
    Key16 at(std::uint64_t i) const { return keyAt(kCountKeySeed, rank(i)); }

  private:
    std::uint64_t n_;
    double logSpan_;
};

// The 100-byte data of entry i: its index in the first 8 bytes, then a
// fixed pattern.
constexpr std::size_t kDataSize = 100;
class Payload {
  public:
    Payload() {
        for (std::size_t i = 0; i < kDataSize; ++i) {
            bytes_[i] = static_cast<unsigned char>('a' + i % 26);
        }
    }
    const unsigned char* forEntry(std::uint64_t i) {
        std::memcpy(bytes_.data(), &i, sizeof i);
        return bytes_.data();
    }

  private:
    std::array<unsigned char, kDataSize> bytes_{};
};

// Reads the entry index back out of a data buffer (for checksums).
inline std::uint64_t entryOf(const void* data) {
    std::uint64_t i;
    std::memcpy(&i, data, sizeof i);
    return i;
}

// Running totals of one side of a read workload; the two sides' tallies
// must agree.
struct Tally {
    std::size_t rows = 0;
    std::uint64_t sum = 0;
    void add(const unsigned char* key, std::size_t keySize, const unsigned char* data) {
        ++rows;
        sum += entryOf(data) * 31 + (keySize > 0 ? key[0] : 0) + keySize;
    }
    // A row of the counting workload: `sum` adds up the counts, to N.
    void addCount(std::uint64_t count) {
        ++rows;
        sum += count;
    }
    bool operator==(const Tally& other) const { return rows == other.rows && sum == other.sum; }
};

// The check every insert workload ends with, inside its timing: after the
// last insert, the first entry in key order and the last key inserted were
// read back. A store that gathers inserts and merges them on the next read
// pays for that merge here, in the workload that caused it. A failed read
// back means the store lost entries: no figure is worth reporting then.
inline void requireReadable(bool readable, const char* who) {
    if (!readable) {
        std::fprintf(stderr, "%s: the inserted entries cannot be read back\n", who);
        std::abort();
    }
}

// Seconds of processor time the process has used (all its threads).
inline double processCpuSeconds() {
    timespec ts{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) * 1e-9;
}

// Seconds on the steady clock.
inline double steadySeconds() {
    return std::chrono::duration<double>(std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

// Times two sides run alternately, chunk by chunk.
// A moment, on both clocks.
struct Times {
    double cpu = 0;   // seconds of processor time used by the process
    double wall = 0;  // seconds on the steady clock
};

class PairTimer {
  public:
    static constexpr std::size_t kUnitsAreOperations = ~std::size_t{0};

    // Runs raw(begin, end) and measured(begin, end) over [0, count) in
    // chunks of `chunk` units, alternating which side runs first. A unit is
    // one operation unless `operations` says how many the whole run makes.
    template <class Raw, class Measured>
    void run(std::size_t count, std::size_t chunk, Raw&& raw, Measured&& measured,
             std::size_t operations = kUnitsAreOperations) {
        bool rawFirst = (runs_++ % 2) == 0;
        for (std::size_t begin = 0; begin < count; begin += chunk) {
            std::size_t end = std::min(count, begin + chunk);
            for (int side = 0; side < 2; ++side) {
                bool doRaw = (side == 0) == rawFirst;
                Times start = now();
                if (doRaw) {
                    raw(begin, end);
                } else {
                    measured(begin, end);
                }
                Times stop = now();
                (doRaw ? raw_ : measured_).add(start, stop);
                if (!doRaw) {
                    lastMeasuredWall_ += stop.wall - start.wall;
                }
            }
            rawFirst = !rawFirst;
        }
        operations_ += operations == kUnitsAreOperations ? count : operations;
    }

    // The measured side's wall time since the previous call (for the
    // benchmark's manual timing).
    double takeMeasuredWallSeconds() {
        double s = lastMeasuredWall_;
        lastMeasuredWall_ = 0;
        return s;
    }

    struct Totals {
        double cpu = 0;   // seconds of processor time
        double wall = 0;  // seconds of elapsed time
        void add(const Times& start, const Times& stop) {
            cpu += stop.cpu - start.cpu;
            wall += stop.wall - start.wall;
        }
    };
    const Totals& raw() const { return raw_; }
    const Totals& measured() const { return measured_; }
    std::size_t operations() const { return operations_; }

  private:
    static Times now() {
        Times t;
        t.wall = steadySeconds();
        t.cpu = processCpuSeconds();
        return t;
    }

    Totals raw_;
    Totals measured_;
    double lastMeasuredWall_ = 0;
    std::size_t operations_ = 0;
    unsigned runs_ = 0;
};

// Reports, over everything the timer ran: <name>_ns and raw_ns, processor
// nanoseconds per operation; ratio, measured / raw processor time; and
// wall_ratio, the same for elapsed time. Processor time is the figure to
// trust on a shared machine (a side that waits for the processor is not
// charged for it); the benchmark is single-threaded, so the process's
// processor time is this thread's.
inline void setPairCounters(benchmark::State& state, const PairTimer& timer,
                            const std::string& name) {
    if (timer.operations() == 0 || timer.raw().cpu <= 0 || timer.raw().wall <= 0) {
        return;
    }
    double ops = static_cast<double>(timer.operations());
    state.counters[name + "_ns"] = timer.measured().cpu * 1e9 / ops;
    state.counters["raw_ns"] = timer.raw().cpu * 1e9 / ops;
    state.counters["ratio"] = timer.measured().cpu / timer.raw().cpu;
    state.counters["wall_ratio"] = timer.measured().wall / timer.raw().wall;
}

// One paired benchmark's timer together with the benchmark's state.
class PairedRun {
  public:
    explicit PairedRun(benchmark::State& state) : state_(state) {}

    // One iteration's timed part: raw and measured over [0, count) as
    // PairTimer::run runs them; the measured side's elapsed time becomes the
    // iteration's (manual) time.
    template <class Raw, class Measured>
    void sides(std::size_t count, std::size_t chunk, Raw&& raw, Measured&& measured,
               std::size_t operations = PairTimer::kUnitsAreOperations) {
        timer_.run(count, chunk, std::forward<Raw>(raw), std::forward<Measured>(measured),
                   operations);
        state_.SetIterationTime(timer_.takeMeasuredWallSeconds());
    }
    const PairTimer& timer() const { return timer_; }

  private:
    benchmark::State& state_;
    PairTimer timer_;
};

// A chunk function for PairedRun::sides over [0, count): work(begin, end),
// and after the last chunk, inside that chunk's timing, atEnd() (an insert
// workload's read back: requireReadable).
template <class Work, class AtEnd>
auto endingWith(std::size_t count, Work work, AtEnd atEnd) {
    return [count, work, atEnd](std::size_t begin, std::size_t end) mutable {
        work(begin, end);
        if (end == count) {
            atEnd();
        }
    };
}

// The frame of every paired benchmark: body(run) makes its tables and runs
// the iterations; a failure skips the benchmark with its message, otherwise
// the pair counters are reported with the measured side called `name`.
template <class Body>
void runPaired(benchmark::State& state, const std::string& name, Body&& body) {
    PairedRun run(state);
    try {
        body(run);
    } catch (const std::exception& e) {
        state.SkipWithError(e.what());
        return;
    }
    setPairCounters(state, run.timer(), name);
}

// Throws `what` unless the raw side read `rows` entries and the measured
// side read the same entries.
inline void checkTallies(const Tally& raw, const Tally& measured, std::size_t rows,
                         const char* what) {
    if (raw.rows != rows || !(raw == measured)) {
        throw std::runtime_error(what);
    }
}

// One workload of a paired program: its name, its function and how many
// iterations it makes.
struct PairedWorkload {
    const char* name;
    void (*fn)(benchmark::State&);
    int iterations;
};

// Takes the workload size out of the arguments into *n and hands the rest to
// Google Benchmark; false when it does not know one of them.
inline bool initialize(int* argc, char** argv, std::int64_t* n) {
    *n = takeWorkloadSize(argc, argv);
    benchmark::Initialize(argc, argv);
    return !benchmark::ReportUnrecognizedArguments(*argc, argv);
}

// Registers the workloads at size n, timed by the measured side's elapsed
// time and shown in milliseconds, runs those the flags select, and shuts
// Google Benchmark down.
inline void runWorkloads(std::int64_t n, const std::vector<PairedWorkload>& workloads) {
    for (const PairedWorkload& w : workloads) {
        benchmark::RegisterBenchmark(w.name, w.fn)
            ->Arg(n)
            ->Iterations(w.iterations)
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
    }
    benchmark::RunSpecifiedBenchmarks();
    benchmark::Shutdown();
}

}  // namespace kov::bench

#endif  // KOVPAGER_BENCH_BENCH_UTIL_H
