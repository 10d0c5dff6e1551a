// FaultPlan: one fault armed on a FaultVfs for a StoreProgram, and the hooks the program asks.
//
//   ScopedFaultVfs vfs;                        // the default VFS before the engine opens
//   FaultPlan plan(vfs.faults(), FaultPlan::Kind::Write, 40, FaultMode::Once, 50);
//   StoreProgram program(choices, plan.options(base));
//   program.begin();
//   plan.arm();
//   for (...) { program.step(); plan.afterStep(); }
//   program.end();
//
// A Once fault fails one call and is spent. A Persistent fault, or a full disk (a space budget of
// `n` bytes), stays armed until `holdSteps` program steps after its first failure, then is
// cleared: the program then reads every table back and compares it with its model.
#ifndef KOVPAGER_TESTS_STORE_PROGRAM_FAULTS_H
#define KOVPAGER_TESTS_STORE_PROGRAM_FAULTS_H

#include <cstdint>
#include <random>
#include <string>
#include <vector>

// The engine binding's header goes before <sqlite3.h> (fault_vfs.h): they share the result-code
// names.
#include "engine/btree.h"
#include "kov_test_access.h"
#include "store_program.h"
// (separate block: clang-format keeps the order)
#include "fault_vfs.h"

namespace kovtest {

class FaultPlan {
  public:
    enum class Kind { Read, Write, TempOpen, FullDisk, Reserve };

    FaultPlan(kov::test::FaultVfs& vfs, Kind kind, std::uint64_t n, kov::test::FaultMode mode,
              int holdSteps)
        : vfs_(vfs), kind_(kind), n_(n), mode_(mode), holdSteps_(holdSteps) {}

    static const char* name(Kind kind) {
        switch (kind) {
            case Kind::Read:
                return "read";
            case Kind::Write:
                return "write";
            case Kind::TempOpen:
                return "temporary-file open";
            case Kind::Reserve:
                return "reservation";
            default:
                return "full disk";
        }
    }
    std::string describe() const {
        std::string s = name(kind_);
        if (kind_ == Kind::FullDisk)
            return s + " at " + std::to_string(n_) + " bytes";
        s += mode_ == kov::test::FaultMode::Once ? " once" : " persistent";
        return s + " at call " + std::to_string(n_);
    }

    ProgramOptions options(ProgramOptions base) {
        base.faultEvents = [this] { return events(); };
        base.faultsArmed = [this] { return armed_; };
        return base;
    }

    void arm() {
        vfs_.resetCounters();
        base_ = events();
        armed_ = true;
        switch (kind_) {
            case Kind::Read:
                vfs_.failAt(kov::test::FaultKind::Read, n_, mode_);
                break;
            case Kind::Write:
                vfs_.failAt(kov::test::FaultKind::Write, n_, mode_);
                break;
            case Kind::TempOpen:
                vfs_.failAt(kov::test::FaultKind::TempOpen, n_, mode_);
                break;
            case Kind::FullDisk:
                vfs_.setSpaceBudget(n_);
                break;
            case Kind::Reserve:
                vfs_.failAt(kov::test::FaultKind::Reserve, n_, mode_);
                break;
        }
    }

    // Clears a fault that has done its work (see above).
    void afterStep() {
        if (!armed_)
            return;
        if (events() == base_)
            return;
        if (kind_ != Kind::FullDisk && mode_ == kov::test::FaultMode::Once) {
            disarm();
            return;
        }
        if (++heldSteps_ >= holdSteps_)
            disarm();
    }

    void disarm() {
        vfs_.clearAll();
        vfs_.clearSpaceBudget();
        armed_ = false;
    }

    bool armed() const { return armed_; }
    // Every failure injected so far, full-disk refusals included.
    std::uint64_t events() const {
        std::uint64_t n = vfs_.fullRefusals();
        for (int k = 0; k < kov::test::kFaultKinds; ++k)
            n += vfs_.injected(static_cast<kov::test::FaultKind>(k));
        return n;
    }
    bool fired() const { return events() != base_; }

  private:
    kov::test::FaultVfs& vfs_;
    Kind kind_;
    std::uint64_t n_;
    kov::test::FaultMode mode_;
    int holdSteps_;
    int heldSteps_ = 0;
    bool armed_ = false;
    std::uint64_t base_ = 0;
};

// One run of the soak program (tests/soak/soak.cpp), everything about it derived from its seed:
// whether a fault is armed, its kind, mode and point, the step it is armed at, how long a
// persistent one is held, the program's mix, and whether its loads are tiny (half of the runs:
// runs written and merged within a few dozen inserts) or the engine's default. The engine's page cache is cut to `cachePages`
// right after the engine opens, so that small records already go through the temporary file.
struct RandomFaultRun {
    static constexpr int kSteps = 2000;

    explicit RandomFaultRun(std::uint32_t runSeed) : seed(runSeed) {
        std::mt19937 meta(runSeed);
        const int kindPick = static_cast<int>(meta() % 5);  // 4 = no fault
        withFault = kindPick != 4;
        kind = static_cast<FaultPlan::Kind>(kindPick % 4);
        mode = (meta() % 2) == 0 ? kov::test::FaultMode::Once : kov::test::FaultMode::Persistent;
        n = kind == FaultPlan::Kind::FullDisk ? 4096 * (1 + meta() % 400) : 1 + meta() % 300;
        armAt = static_cast<int>(meta() % 1500);
        hold = 1 + static_cast<int>(meta() % 40);
        // Resets inside a run leave stale host objects that crowd out new ones: one run in four.
        allowReset = (meta() % 4) == 0;
        wideKeys = (meta() % 2) == 0;
        tinyLoads = (meta() % 2) == 0;
    }

    ProgramOptions options(int cachePages, bool trace) const {
        ProgramOptions o;
        o.oddInputs = true;
        o.bigPercent = 30;
        o.bigMin = 500;
        o.bigMax = 6000;
        o.insertPercent = 60;
        o.destroyTablePercent = 5;
        o.readerPercent = 10;
        o.allowReset = allowReset;
        o.wideKeys = wideKeys;
        o.trace = trace;
        o.loads = tinyLoads ? kov::engine::test::kTinyLoads : kov::engine::kDefaultLoadLimits;
        o.onEngineOpened = [cachePages] {
            kov::engine::sqlite3BtreeSetCacheSize(KovTestAccess::engine(), cachePages);
        };
        return o;
    }

    std::uint32_t seed;
    bool withFault;
    FaultPlan::Kind kind;
    kov::test::FaultMode mode;
    std::uint64_t n;
    int armAt;
    int hold;
    bool allowReset;
    bool wideKeys;
    bool tinyLoads;
};

struct RandomFaultResult {
    std::string plan;  // the fault, described
    std::uint64_t operations = 0;
    std::uint64_t mismatches = 0;
    bool degraded = false;
    bool writesRefused = false;  // a fault ended the write transaction (see StoreProgram)
    FaultReport report;
    LoadReport loads;
    std::vector<std::string> mismatchTexts;
};

// Runs one soak run through `vfs` (registered as the default VFS).
inline RandomFaultResult runRandomFaultRun(kov::test::FaultVfs& vfs, const RandomFaultRun& run,
                                           int cachePages, bool trace) {
    FaultPlan plan(vfs, run.kind, run.n, run.mode, run.hold);
    SeededChoices choices(run.seed);
    StoreProgram program(choices, plan.options(run.options(cachePages, trace)));
    program.begin();
    for (int i = 0; i < RandomFaultRun::kSteps && !program.stopped(); ++i) {
        if (run.withFault && i == run.armAt)
            plan.arm();
        program.step();
        plan.afterStep();
    }
    plan.disarm();
    RandomFaultResult result;
    result.plan = run.withFault ? plan.describe() : "no fault";
    result.degraded = program.degraded() || program.dirty();
    result.writesRefused = program.writesRefused();
    program.end();
    result.operations = program.operations();
    result.mismatches = program.mismatches();
    result.report = program.faultReport();
    result.loads = program.loadReport();
    result.mismatchTexts = program.mismatchTexts();
    return result;
}

}  // namespace kovtest

#endif  // KOVPAGER_TESTS_STORE_PROGRAM_FAULTS_H
