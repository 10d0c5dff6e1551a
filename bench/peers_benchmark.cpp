// The store against its peers: one workload on one backend per process, so
// each backend's peak memory and scratch files are its own.
//
//     peers_benchmark --backend NAME --workload W --n N [--scratch DIR]
//     peers_benchmark --list          (the backends built into this program)
//     peers_benchmark                 (no task: prints how it is driven, exits 0;
//                                      Google Benchmark's --benchmark_* flags are ignored)
//
// Backends: store (KovBtree / KovBtreeCursor), sqlite (hand-written SQL with
// the store's settings), map (std::map, the in-memory ceiling), and, when
// found at build time, lmdb and rocksdb (settings in bench/peers_lmdb.h and
// bench/peers_rocksdb.h).
//
// Workloads (N entries; data is 100 bytes; keys are made on the fly, so no
// process holds a copy of the workload):
//   W1  N inserts of the integer keys 0..N-1, in order
//   W2  the same keys in a shuffled order
//   W3  N inserts of random 16-byte keys
//   W4  W3's table filled, then ordered walks reading every key and data
//   W5  W3's table filled, then rounds of max(N/10, min(N, 100 000)) seeks of
//       existing keys reading the data
//   W6  N key-only inserts, in random order, of 16-byte composite keys (an
//       8-byte prefix naming one of 1 000 groups, then an 8-byte payload),
//       then rounds of every group walked by its prefix (the time is per
//       entry walked)
//   W7  read-modify-write counting: N draws of 16-byte keys from a skewed law
//       over N distinct keys (bench_util.h, SkewedDraws: Zipf-like, about a
//       fifth of the keys come up), each a lookup of the key's 8-byte count
//       and a write of count + 1 (1 when absent); then one walk of the counts
//       in key order, key and count read (the time is per draw, the walk
//       included; the tally is the rows and the sum of the counts, N)
// Every insert phase (W1..W3, the fills of W4..W6, W7's draws) ends, inside
// its timing, with the entries read back: the first entry in key order and a
// lookup of the last key inserted, which must be found. A backend that
// defers work to the next read pays for it where the inserts caused it.
// The read phase of W4..W6 is made again until it has taken 0.2 s of
// processor time (once at least; the figure is per operation over all the
// rounds). W4..W6 also report their fill phase (fill_ns_cpu / fill_ns_wall).
//
// Output: one JSON line: processor and elapsed nanoseconds per operation of
// the measured phase (processor time is that of the whole process, so a
// backend's own background threads are charged to it), that processor time
// split into user and kernel time, the read and write system calls per
// operation and the bytes they moved (/proc/self/io), the same for the fill
// phase of W4..W6 (fill_...; zeros elsewhere), the peak resident
// set (getrusage ru_maxrss), the scratch disk in use at the end (allocated
// bytes of the files under the scratch directory, including the unlinked
// temporary file SQLite keeps open), and the read tally (rows, sum), which
// must agree across backends.
//
// Scratch: DIR/<backend>-<pid>, removed at exit; the store finds it through
// KOV_TEMP and raw SQLite through SQLITE_TMPDIR, both set before anything
// opens. DIR defaults to peers-scratch beside the program.
#include <ftw.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <memory>
#include <string>

#include "bench/bench_util.h"
#include "bench/peers_map.h"
#include "bench/peers_raw.h"
#include "bench/peers_face.h"
#include "bench/peers_store.h"
#include "bench/peers_workloads.h"
#if defined(KOV_PEERS_HAVE_LMDB)
#include "bench/peers_lmdb.h"
#endif
#if defined(KOV_PEERS_HAVE_ROCKSDB)
#include "bench/peers_rocksdb.h"
#endif

namespace {

using kov::bench::kDataSize;
using kov::bench::Key16;
using kov::bench::Payload;
using kov::bench::Tally;
using kov::peers::CompositeKeys;
using kov::peers::RandomKeys;
using kov::peers::Shuffle;
using kov::peers::SkewedDraws;

// What the process has used so far: processor time (also split into user
// and kernel time), elapsed time on the steady clock, and its I/O system
// calls with the bytes they moved (/proc/self/io; zeros where the system has
// no such file). Usage::now() is a moment, times in seconds; perOp makes the
// same fields per operation between two moments, times in nanoseconds.
struct Usage {
    double cpu = 0;
    double wall = 0;
    double user = 0;
    double sys = 0;
    double reads = 0;      // read system calls (syscr)
    double writes = 0;     // write system calls (syscw)
    double readBytes = 0;  // bytes they moved (rchar, wchar)
    double writeBytes = 0;

    static Usage now() {
        Usage u;
        if (FILE* f = std::fopen("/proc/self/io", "r")) {
            char name[64];
            unsigned long long value = 0;
            while (std::fscanf(f, "%63[^:]: %llu\n", name, &value) == 2) {
                const std::string field = name;
                if (field == "syscr") u.reads = static_cast<double>(value);
                if (field == "syscw") u.writes = static_cast<double>(value);
                if (field == "rchar") u.readBytes = static_cast<double>(value);
                if (field == "wchar") u.writeBytes = static_cast<double>(value);
            }
            std::fclose(f);
        }
        rusage usage{};
        getrusage(RUSAGE_SELF, &usage);
        u.user = static_cast<double>(usage.ru_utime.tv_sec) +
                 static_cast<double>(usage.ru_utime.tv_usec) * 1e-6;
        u.sys = static_cast<double>(usage.ru_stime.tv_sec) +
                static_cast<double>(usage.ru_stime.tv_usec) * 1e-6;
        u.cpu = kov::bench::processCpuSeconds();
        u.wall = kov::bench::steadySeconds();
        return u;
    }

    static Usage perOp(const Usage& start, const Usage& stop, std::uint64_t ops) {
        Usage p;
        if (ops > 0) {
            const double n = static_cast<double>(ops);
            p.cpu = (stop.cpu - start.cpu) * 1e9 / n;
            p.wall = (stop.wall - start.wall) * 1e9 / n;
            p.user = (stop.user - start.user) * 1e9 / n;
            p.sys = (stop.sys - start.sys) * 1e9 / n;
            p.reads = (stop.reads - start.reads) / n;
            p.writes = (stop.writes - start.writes) / n;
            p.readBytes = (stop.readBytes - start.readBytes) / n;
            p.writeBytes = (stop.writeBytes - start.writeBytes) / n;
        }
        return p;
    }
};

struct Result {
    std::uint64_t ops = 0;
    // Per operation, of the measured phase and of the fill phase.
    Usage measured;
    Usage fill;
    std::uint64_t missing = 0;  // seeks that found nothing (must be 0)
    Tally tally;
    std::uint64_t diskBytes = 0;
};

// ---- scratch directory ----

std::uint64_t gDiskBytes = 0;
int addFile(const char* /*path*/, const struct stat* st, int type, struct FTW* /*ftw*/) {
    if (type == FTW_F) {
        gDiskBytes += static_cast<std::uint64_t>(st->st_blocks) * 512;
    }
    return 0;
}
int removeEntry(const char* path, const struct stat* /*st*/, int /*type*/, struct FTW* /*ftw*/) {
    std::remove(path);
    return 0;
}

// Allocated bytes of the files under `dir`, and of unlinked files under it
// that this process still holds open.
std::uint64_t diskInUse(const std::string& dir) {
    gDiskBytes = 0;
    nftw(dir.c_str(), addFile, 16, FTW_PHYS);
    for (int fd = 0; fd < 4096; ++fd) {
        std::string link = "/proc/self/fd/" + std::to_string(fd);
        char target[4096];
        ssize_t len = readlink(link.c_str(), target, sizeof target - 1);
        if (len <= 0) {
            continue;
        }
        std::string name(target, static_cast<std::size_t>(len));
        static const std::string kDeleted = " (deleted)";
        if (name.compare(0, dir.size(), dir) == 0 && name.size() > kDeleted.size() &&
            name.compare(name.size() - kDeleted.size(), kDeleted.size(), kDeleted) == 0) {
            struct stat st {};
            if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) {
                gDiskBytes += static_cast<std::uint64_t>(st.st_blocks) * 512;
            }
        }
    }
    return gDiskBytes;
}

// ---- workloads ----

// The end of every insert phase: the entries read back (bench_util.h).
template <class Backend>
void readBack(Backend& b, std::int64_t lastKey) {
    kov::bench::requireReadable(b.readable(lastKey), Backend::kName);
}
template <class Backend>
void readBack(Backend& b, const Key16& lastKey) {
    kov::bench::requireReadable(b.readable(lastKey.data(), lastKey.size()), Backend::kName);
}

template <class Backend>
void fillRandom(Backend& b, std::uint64_t n) {
    b.beginBlob();
    RandomKeys keys(n);
    Payload data;
    for (std::uint64_t i = 0; i < n; ++i) {
        Key16 k = keys.at(i);
        b.blobInsert(k.data(), k.size(), data.forEntry(i), kDataSize);
    }
    readBack(b, keys.at(n - 1));
}

// The read phase of W4..W6, made again until it has taken kMinReadSeconds of
// processor time: one pass at N = 100 000 takes a few milliseconds, too short
// for a shared machine whose speed drifts. Returns the operations of all the
// passes; `tally` keeps the first pass's reads (the other passes read the
// same), so it agrees across backends.
constexpr double kMinReadSeconds = 0.2;

template <class Pass>
std::uint64_t repeatReads(Tally& tally, Pass pass) {
    const Usage start = Usage::now();
    std::uint64_t ops = pass(tally);
    while (Usage::now().cpu - start.cpu < kMinReadSeconds) {
        Tally again;
        ops += pass(again);
    }
    return ops;
}

template <class Backend>
Result runWorkload(Backend& b, const std::string& workload, std::uint64_t n,
                   const std::string& scratch) {
    Result r;
    Payload data;
    if (workload == "W1" || workload == "W2") {
        b.beginInt();
        Shuffle order(n);
        bool shuffled = workload == "W2";
        Usage start = Usage::now();
        std::uint64_t key = 0;
        for (std::uint64_t i = 0; i < n; ++i) {
            key = shuffled ? order.at(i) : i;
            b.intInsert(static_cast<std::int64_t>(key), data.forEntry(key), kDataSize);
        }
        readBack(b, static_cast<std::int64_t>(key));
        r.ops = n;
        r.measured = Usage::perOp(start, Usage::now(), n);
    } else if (workload == "W3") {
        Usage start = Usage::now();
        fillRandom(b, n);
        r.ops = n;
        r.measured = Usage::perOp(start, Usage::now(), n);
    } else if (workload == "W4") {
        Usage start = Usage::now();
        fillRandom(b, n);
        Usage filled = Usage::now();
        r.fill = Usage::perOp(start, filled, n);
        r.ops = repeatReads(r.tally, [&](Tally& tally) {
            b.scan([&](const unsigned char* key, std::size_t keySize, const unsigned char* data,
                       std::size_t /*dataSize: 100*/) { tally.add(key, keySize, data); });
            return tally.rows;
        });
        r.measured = Usage::perOp(filled, Usage::now(), r.ops);
    } else if (workload == "W5") {
        Usage start = Usage::now();
        fillRandom(b, n);
        Usage filled = Usage::now();
        r.fill = Usage::perOp(start, filled, n);
        std::uint64_t seeks = std::max<std::uint64_t>(n / 10, std::min<std::uint64_t>(n, 100000));
        RandomKeys keys(n);
        r.ops = repeatReads(r.tally, [&](Tally& tally) {
            kov::bench::Random pick(kov::bench::kSeekSeed);
            for (std::uint64_t j = 0; j < seeks; ++j) {
                Key16 k = keys.at(pick.below(n));
                if (!b.seek(k.data(), k.size(), tally)) {
                    ++r.missing;
                }
            }
            return seeks;
        });
        r.measured = Usage::perOp(filled, Usage::now(), r.ops);
    } else if (workload == "W6") {
        b.beginKeys();
        CompositeKeys c;
        Usage start = Usage::now();
        Key16 k{};
        for (std::uint64_t i = 0; i < n; ++i) {
            k = c.next();
            b.keyInsert(k.data(), k.size());
        }
        readBack(b, k);
        Usage filled = Usage::now();
        r.fill = Usage::perOp(start, filled, n);
        r.ops = repeatReads(r.tally, [&](Tally& tally) {
            std::uint64_t walked = 0;
            for (std::size_t g = 0; g < CompositeKeys::kGroups; ++g) {
                walked += b.walk(c.walkPrefix(g), CompositeKeys::kPrefixSize, tally);
            }
            return walked;
        });
        r.measured = Usage::perOp(filled, Usage::now(), r.ops);
    } else if (workload == "W7") {
        b.beginCounts();
        SkewedDraws draws(n);
        Usage start = Usage::now();
        Key16 k{};
        for (std::uint64_t i = 0; i < n; ++i) {
            k = draws.at(i);
            b.increment(k.data(), k.size());
        }
        readBack(b, k);
        b.scan([&](const unsigned char* /*key*/, std::size_t /*keySize*/,
                   const unsigned char* count, std::size_t countSize) {
            std::uint64_t c = 0;
            std::memcpy(&c, count, std::min(countSize, sizeof c));
            r.tally.addCount(c);
        });
        r.ops = n;
        r.measured = Usage::perOp(start, Usage::now(), n);
        if (r.tally.sum != n) {
            throw std::runtime_error("W7: the counts add up to " + std::to_string(r.tally.sum) +
                                     ", not " + std::to_string(n));
        }
    } else {
        throw std::runtime_error("unknown workload " + workload + " (W1..W7)");
    }
    r.diskBytes = diskInUse(scratch);
    return r;
}

template <class Backend>
Result runOn(const std::string& workload, std::uint64_t n, const std::string& scratch) {
    auto backend = std::make_unique<Backend>(scratch);
    return runWorkload(*backend, workload, n, scratch);
}

const char* const kBackends[] = {
    "store",   "face",   "sqlite", "map",
#if defined(KOV_PEERS_HAVE_LMDB)
    "lmdb",
#endif
#if defined(KOV_PEERS_HAVE_ROCKSDB)
    "rocksdb",
#endif
};

Result run(const std::string& backend, const std::string& workload, std::uint64_t n,
           const std::string& scratch) {
    if (backend == "store") {
        return runOn<kov::peers::StoreBackend>(workload, n, scratch);
    }
    if (backend == "face") {
        return runOn<kov::peers::FaceBackend>(workload, n, scratch);
    }
    if (backend == "sqlite") {
        return runOn<kov::peers::RawBackend>(workload, n, scratch);
    }
    if (backend == "map") {
        return runOn<kov::peers::MapBackend>(workload, n, scratch);
    }
#if defined(KOV_PEERS_HAVE_LMDB)
    if (backend == "lmdb") {
        return runOn<kov::peers::LmdbBackend>(workload, n, scratch);
    }
#endif
#if defined(KOV_PEERS_HAVE_ROCKSDB)
    if (backend == "rocksdb") {
        return runOn<kov::peers::RocksdbBackend>(workload, n, scratch);
    }
#endif
    throw std::runtime_error("unknown or not built backend " + backend + " (see --list)");
}

std::string programDir(const char* argv0) {
    char self[4096];
    ssize_t len = readlink("/proc/self/exe", self, sizeof self - 1);
    std::string path = len > 0 ? std::string(self, static_cast<std::size_t>(len)) : argv0;
    std::size_t slash = path.rfind('/');
    return slash == std::string::npos ? "." : path.substr(0, slash);
}

int usage() {
    std::fprintf(stderr,
                 "usage: peers_benchmark --backend NAME --workload W1..W7 --n N [--scratch DIR]\n"
                 "       peers_benchmark --list\n");
    return 2;
}

}  // namespace

int main(int argc, char** argv) {
    std::string backend;
    std::string workload;
    std::uint64_t n = 0;
    std::string scratchRoot = programDir(argv[0]) + "/peers-scratch";
    bool anyOption = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        // The project's `make bench` hands every benchmark program Google
        // Benchmark's flags; they mean nothing here.
        if (arg.compare(0, 12, "--benchmark_") == 0) {
            continue;
        }
        anyOption = true;
        if (arg == "--list") {
            for (const char* name : kBackends) {
                std::printf("%s\n", name);
            }
            return 0;
        }
        if (i + 1 >= argc) {
            return usage();
        }
        std::string value = argv[++i];
        if (arg == "--backend") {
            backend = value;
        } else if (arg == "--workload") {
            workload = value;
        } else if (arg == "--n") {
            n = std::strtoull(value.c_str(), nullptr, 10);
        } else if (arg == "--scratch") {
            scratchRoot = value;
        } else {
            return usage();
        }
    }
    if (!anyOption) {
        // Run without a task (as `make bench` runs every benchmark program):
        // say how this one is driven instead of failing.
        std::printf(
            "peers_benchmark runs one backend and workload per process; "
            "bench/run_peers.py drives it (see bench/RESULTS.md)\n");
        return 0;
    }
    if (backend.empty() || workload.empty() || n == 0) {
        return usage();
    }

    mkdir(scratchRoot.c_str(), 0700);
    char real[4096];
    if (realpath(scratchRoot.c_str(), real) == nullptr) {
        std::fprintf(stderr, "peers_benchmark: no scratch directory %s\n", scratchRoot.c_str());
        return 1;
    }
    std::string scratch = std::string(real) + "/" + backend + "-" + std::to_string(getpid());
    if (mkdir(scratch.c_str(), 0700) != 0) {
        std::fprintf(stderr, "peers_benchmark: cannot make %s\n", scratch.c_str());
        return 1;
    }
    setenv("KOV_TEMP", scratch.c_str(), 1);
    setenv("SQLITE_TMPDIR", scratch.c_str(), 1);

    int status = 0;
    try {
        Result r = run(backend, workload, n, scratch);
        rusage usage{};
        getrusage(RUSAGE_SELF, &usage);
        std::printf(
            "{\"backend\":\"%s\",\"workload\":\"%s\",\"n\":%llu,\"ops\":%llu,"
            "\"ns_cpu\":%.1f,\"ns_wall\":%.1f,\"fill_ns_cpu\":%.1f,\"fill_ns_wall\":%.1f,"
            "\"ns_user\":%.1f,\"ns_sys\":%.1f,\"reads_per_op\":%.3f,\"writes_per_op\":%.3f,"
            "\"read_bytes_per_op\":%.0f,\"write_bytes_per_op\":%.0f,"
            "\"fill_ns_user\":%.1f,\"fill_ns_sys\":%.1f,\"fill_reads_per_op\":%.3f,"
            "\"fill_writes_per_op\":%.3f,\"fill_read_bytes_per_op\":%.0f,"
            "\"fill_write_bytes_per_op\":%.0f,"
            "\"peak_rss_kib\":%ld,\"disk_bytes\":%llu,\"rows\":%llu,\"sum\":%llu,"
            "\"missing\":%llu}\n",
            backend.c_str(), workload.c_str(), static_cast<unsigned long long>(n),
            static_cast<unsigned long long>(r.ops), r.measured.cpu, r.measured.wall, r.fill.cpu,
            r.fill.wall, r.measured.user, r.measured.sys, r.measured.reads, r.measured.writes,
            r.measured.readBytes, r.measured.writeBytes, r.fill.user, r.fill.sys, r.fill.reads,
            r.fill.writes, r.fill.readBytes, r.fill.writeBytes, usage.ru_maxrss,
            static_cast<unsigned long long>(r.diskBytes),
            static_cast<unsigned long long>(r.tally.rows),
            static_cast<unsigned long long>(r.tally.sum),
            static_cast<unsigned long long>(r.missing));
        status = r.missing == 0 ? 0 : 1;
    } catch (const std::exception& e) {
        std::fprintf(stderr, "peers_benchmark: %s\n", e.what());
        status = 1;
    }
    std::fflush(stdout);
    nftw(scratch.c_str(), removeEntry, 16, FTW_DEPTH | FTW_PHYS);
    return status;
}
