// Soak run of the store: the model-based store program (tests/lib/store_program.h) over and over,
// each run with a randomly chosen I/O fault (a failed read or write, a temporary file that cannot
// be created, a full disk; once or for a while) armed at a random point, until the time is up.
//
//   soak --seconds 600 [--seed 1] [--cache-pages 16]
//   soak --run SEED          repeats the one run of that seed (as printed with a mismatch)
//
// The engine's page cache is cut to a few pages right after each engine opens (default 16 pages),
// so that the temporary file is written and read within a few thousand small records instead of
// the store's 64 MiB. Half of the runs gather their inserts in a load buffer of about 1 KiB
// (runs written and merged within a few dozen inserts). Prints, every minute and at the end, the
// operations made, the faults injected, what the programs found after them, what the loads did,
// and the mismatches with the model (there must be none), and at the end what was found after each kind of fault (with the seeds of the first runs
// that left a table broken). Exit status 0 when there was no mismatch, 1 otherwise, 2 on bad
// arguments.
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "store_program.h"
#include "store_program_faults.h"
// After the engine binding's header, which shares SQLite's result-code names.
#include "fault_vfs.h"

namespace {

struct Totals {
    std::uint64_t runs = 0;
    std::uint64_t operations = 0;
    std::uint64_t mismatches = 0;
    std::uint64_t runsFaulted = 0;
    std::uint64_t runsDegraded = 0;
    std::uint64_t faultedSteps = 0;
    std::uint64_t tablesIntact = 0;
    std::uint64_t tablesLostSome = 0;
    std::uint64_t tablesChanged = 0;
    std::uint64_t tablesBroken = 0;
    std::uint64_t entriesLost = 0;
    std::uint64_t refusedDropped = 0;
    std::uint64_t refusedStored = 0;
    std::uint64_t damagedButReadable = 0;
    std::uint64_t runsWritesRefused = 0;
    // Loads (store_program.h, LoadReport), over the runs with tiny loads and over all.
    std::uint64_t runsTinyLoads = 0;
    kovtest::LoadReport loads;
    std::uint64_t entriesLostGathered = 0;
    std::uint64_t entriesLostMerged = 0;
    std::uint64_t tablesAsMerged = 0;
    std::uint64_t tablesNotAsMerged = 0;
    std::uint64_t tablesUncertain = 0;
};

// What the runs of one fault kind found after their fault.
struct KindTotals {
    std::uint64_t runs = 0;  // runs in which a fault of this kind was injected
    std::uint64_t writesRefused = 0;
    std::uint64_t degraded = 0;
    std::uint64_t tablesIntact = 0;
    std::uint64_t tablesLostSome = 0;
    std::uint64_t tablesChanged = 0;
    std::uint64_t tablesBroken = 0;
    std::uint64_t refusedStored = 0;
    std::vector<std::uint32_t> brokenSeeds;  // the first few runs that left a table broken
};

constexpr int kKinds = 4;

void printKinds(const KindTotals (&k)[kKinds]) {
    for (int i = 0; i < kKinds; ++i) {
        std::printf(
            "  %s: runs %llu, writes refused after it %llu, degraded %llu; tables intact %llu, "
            "lost some %llu, changed %llu, broken %llu; refused inserts stored %llu\n",
            kovtest::FaultPlan::name(static_cast<kovtest::FaultPlan::Kind>(i)),
            static_cast<unsigned long long>(k[i].runs),
            static_cast<unsigned long long>(k[i].writesRefused),
            static_cast<unsigned long long>(k[i].degraded),
            static_cast<unsigned long long>(k[i].tablesIntact),
            static_cast<unsigned long long>(k[i].tablesLostSome),
            static_cast<unsigned long long>(k[i].tablesChanged),
            static_cast<unsigned long long>(k[i].tablesBroken),
            static_cast<unsigned long long>(k[i].refusedStored));
        if (!k[i].brokenSeeds.empty()) {
            std::printf("    broken tables in runs");
            for (std::uint32_t seed : k[i].brokenSeeds)
                std::printf(" %u", seed);
            std::printf("\n");
        }
    }
    std::fflush(stdout);
}

void print(const char* what, const Totals& t, double seconds) {
    std::printf(
        "%s after %.0f s: runs %llu, operations %llu, mismatches %llu; runs with a fault %llu "
        "(degraded %llu), faulted operations %llu; tables after a fault: intact %llu, lost some "
        "%llu, changed %llu, broken %llu; entries lost %llu; refused inserts dropped %llu, "
        "stored %llu; damaged databases whose tables all read back %llu; runs ending with writes "
        "refused %llu\n",
        what, seconds, static_cast<unsigned long long>(t.runs),
        static_cast<unsigned long long>(t.operations),
        static_cast<unsigned long long>(t.mismatches),
        static_cast<unsigned long long>(t.runsFaulted),
        static_cast<unsigned long long>(t.runsDegraded),
        static_cast<unsigned long long>(t.faultedSteps),
        static_cast<unsigned long long>(t.tablesIntact),
        static_cast<unsigned long long>(t.tablesLostSome),
        static_cast<unsigned long long>(t.tablesChanged),
        static_cast<unsigned long long>(t.tablesBroken),
        static_cast<unsigned long long>(t.entriesLost),
        static_cast<unsigned long long>(t.refusedDropped),
        static_cast<unsigned long long>(t.refusedStored),
        static_cast<unsigned long long>(t.damagedButReadable),
        static_cast<unsigned long long>(t.runsWritesRefused));
    std::printf(
        "  loads: runs with tiny loads %llu; inserts gathered %llu, runs written %llu, merges %llu "
        "(by appending %llu, by inserts %llu, of runs sharing a key %llu); tables created, resets "
        "and tables destroyed with entries gathered %llu; after a fault that ended the writes: "
        "tables as merged %llu, not as merged %llu, uncertain %llu; gathered entries lost %llu, "
        "merged entries lost %llu\n",
        static_cast<unsigned long long>(t.runsTinyLoads),
        static_cast<unsigned long long>(t.loads.engine.gathered),
        static_cast<unsigned long long>(t.loads.engine.runsWritten),
        static_cast<unsigned long long>(t.loads.engine.merges),
        static_cast<unsigned long long>(t.loads.engine.mergedByAppend),
        static_cast<unsigned long long>(t.loads.mergesByInserts),
        static_cast<unsigned long long>(t.loads.mergesOverEqualKeys),
        static_cast<unsigned long long>(t.loads.createdWithPending + t.loads.resetsWithPending +
                                        t.loads.destroyedWithPending),
        static_cast<unsigned long long>(t.tablesAsMerged),
        static_cast<unsigned long long>(t.tablesNotAsMerged),
        static_cast<unsigned long long>(t.tablesUncertain),
        static_cast<unsigned long long>(t.entriesLostGathered),
        static_cast<unsigned long long>(t.entriesLostMerged));
    std::fflush(stdout);
}

}  // namespace

int main(int argc, char** argv) {
    double seconds = 60;
    std::uint32_t seed = 1;
    int cachePages = 16;
    bool replay = false;
    std::uint32_t replaySeed = 0;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--seconds" && i + 1 < argc) {
            seconds = std::atof(argv[++i]);
        } else if (arg == "--seed" && i + 1 < argc) {
            seed = static_cast<std::uint32_t>(std::strtoul(argv[++i], nullptr, 10));
        } else if (arg == "--run" && i + 1 < argc) {
            replay = true;
            replaySeed = static_cast<std::uint32_t>(std::strtoul(argv[++i], nullptr, 10));
        } else if (arg == "--cache-pages" && i + 1 < argc) {
            cachePages = std::atoi(argv[++i]);
        } else {
            std::fprintf(stderr,
                         "usage: %s [--seconds N] [--seed S] [--cache-pages P] [--run SEED]\n",
                         argv[0]);
            return 2;
        }
    }

    using Clock = std::chrono::steady_clock;
    const auto start = Clock::now();
    auto elapsed = [&] { return std::chrono::duration<double>(Clock::now() - start).count(); };
    double nextReport = 60;
    std::mt19937 runs(seed);
    Totals totals;
    KindTotals kinds[kKinds] = {};
    kov::test::ScopedFaultVfs vfs;
    if (vfs.registerRc() != SQLITE_OK) {
        std::fprintf(stderr, "cannot register the fault-injecting VFS\n");
        return 2;
    }

    while (elapsed() < seconds) {
        const std::uint32_t runSeed = replay ? replaySeed : static_cast<std::uint32_t>(runs());
        // Everything about a run follows from its seed, so that `--run SEED` repeats it.
        const kovtest::RandomFaultRun run(runSeed);
        const kovtest::RandomFaultResult result = kovtest::runRandomFaultRun(
            vfs.faults(), run, cachePages, replay && std::getenv("KOV_SOAK_TRACE") != nullptr);
        const bool degraded = result.degraded;
        const kovtest::FaultReport& r = result.report;
        ++totals.runs;
        totals.operations += result.operations;
        totals.mismatches += result.mismatches;
        totals.runsFaulted += r.faultedSteps > 0 ? 1 : 0;
        totals.runsDegraded += degraded ? 1 : 0;
        totals.faultedSteps += r.faultedSteps;
        totals.tablesIntact += r.tablesIntact;
        totals.tablesLostSome += r.tablesLostSome;
        totals.tablesChanged += r.tablesChanged;
        totals.tablesBroken += r.tablesBroken;
        totals.entriesLost += r.entriesLost;
        totals.refusedDropped += r.refusedInsertsDropped;
        totals.refusedStored += r.refusedInsertsStored;
        totals.damagedButReadable += r.damagedButReadable;
        totals.runsWritesRefused += result.writesRefused ? 1 : 0;
        totals.runsTinyLoads += run.tinyLoads ? 1 : 0;
        kovtest::addLoads(totals.loads, result.loads);
        totals.entriesLostGathered += r.entriesLostGathered;
        totals.entriesLostMerged += r.entriesLostMerged;
        totals.tablesAsMerged += r.tablesAsMerged;
        totals.tablesNotAsMerged += r.tablesNotAsMerged;
        totals.tablesUncertain += r.tablesUncertain;
        if (r.faultedSteps > 0) {
            KindTotals& k = kinds[static_cast<int>(run.kind)];
            ++k.runs;
            k.writesRefused += result.writesRefused ? 1 : 0;
            k.degraded += degraded ? 1 : 0;
            k.tablesIntact += r.tablesIntact;
            k.tablesLostSome += r.tablesLostSome;
            k.tablesChanged += r.tablesChanged;
            k.tablesBroken += r.tablesBroken;
            k.refusedStored += r.refusedInsertsStored;
            if (r.tablesBroken > 0 && k.brokenSeeds.size() < 3)
                k.brokenSeeds.push_back(runSeed);
        }
        if (result.mismatches != 0) {
            std::printf("MISMATCH in run %llu (run seed %u, %s, armed at step %d, %s%s%s):\n",
                        static_cast<unsigned long long>(totals.runs), runSeed, result.plan.c_str(),
                        run.armAt, run.wideKeys ? "wide keys" : "narrow keys",
                        run.allowReset ? ", resets" : "", run.tinyLoads ? ", tiny loads" : "");
            std::size_t shown = 0;
            for (const std::string& text : result.mismatchTexts) {
                if (++shown > 3 && !replay)
                    break;
                std::printf("  %s\n", text.c_str());
            }
        }
        if (replay)
            break;
        if (elapsed() >= nextReport) {
            print("progress", totals, elapsed());
            nextReport += 60;
        }
    }
    print("done", totals, elapsed());
    printKinds(kinds);
    return totals.mismatches == 0 ? 0 : 1;
}
