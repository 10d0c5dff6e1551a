// StoreProgram: a program of host actions run against the store and, step by step, against an
// in-memory model of what the store must answer. Shared by the model test, the fault test, the
// store fuzz target and its regression test, and the soak program; store_program.cpp holds the
// model and every action, compiled once (the test library kov_store_program).
//
// The actions are those a host may take: tables of every kind (out-of-range kinds included) made
// and destroyed, read and writing cursors made and destroyed, inserts with replacement, seeks,
// moves, reads, composite-key seeks and fetches, tables made while cursors stand anywhere, reset,
// and (as an option) pager copies taken, assigned back and reset. Every choice is taken from a
// ChoiceSource: a seeded generator, or the bytes of a fuzz input.
//
// The model keeps the engine's view: a map from root page to table contents, and one record per
// registry slot with the state of its engine cursor (none, open, inert after reset), whether it
// writes and where it stands. It encodes the store's refusals: read cursors lock writers out of
// their table, inserts through read cursors add nothing, drops are refused while any cursor is
// open, every cursor on a table is on no entry after an insert into it, table creation closes
// every live slot and reopens it as a writing cursor searched to its saved key, and the key forms
// that do not match a table's kind (an integer table takes a byte-string form's length as its
// integer key; a byte-string table refuses the integer forms).
//
// Every answer that differs from the model is a mismatch: counted, and the first few kept as text.
//
// Faults. A program may run with an I/O fault armed (see fault_vfs.h). The caller says how many
// faults have been injected so far (faultEvents) and whether one is still armed (faultsArmed).
// A step during which a fault was injected is not checked, and the program is "dirty" from then
// on: steps are made but not checked while the fault stays armed. Once it is disarmed the model
// is set from what the engine holds (resync): every model table is read back through the engine,
// compared with the model (the comparison is recorded in faultReport()), and taken as the truth;
// every live slot takes its handle and position from the store. When every table reads back
// without error and SQLite's integrity check of the whole database passes, everything is
// checked strictly again, and so it is when only the consistency check fails while the engine
// refuses writes (nothing can change then). Otherwise (a damaged database) what the engine
// answers is not defined: the program goes on unchecked ("degraded": no crash and no hang is all
// that is asked) until a reset opens a fresh engine. A fault ends the engine's write
// transaction: it refuses every later write until it is closed, silently at the store's
// interface: the model then takes every insert as a no-op, every table creation as a table on root
// page 0 (no cursor opens on it) and every table destruction as refused, until a reset opens a
// fresh engine.
#ifndef KOVPAGER_TESTS_STORE_PROGRAM_H
#define KOVPAGER_TESTS_STORE_PROGRAM_H

#include <cstdint>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine_test_util.h"

namespace kovtest {

// Where a program takes its choices from.
class ChoiceSource {
  public:
    virtual ~ChoiceSource() = default;
    // A number in 0..n-1 (n >= 1).
    virtual std::uint32_t pick(std::uint32_t n) = 0;
    // True when a byte source has nothing left: the program stops.
    virtual bool exhausted() const { return false; }
};

class SeededChoices : public ChoiceSource {
  public:
    explicit SeededChoices(std::uint32_t seed) : rng_(seed) {}
    std::uint32_t pick(std::uint32_t n) override { return static_cast<std::uint32_t>(rng_() % n); }

  private:
    std::mt19937 rng_;
};

// Reads one byte per choice of up to 256 values, two for up to 65536, four above; zeros once the
// bytes run out.
class ByteChoices : public ChoiceSource {
  public:
    ByteChoices(const std::uint8_t* data, std::size_t size) : data_(data), size_(size) {}
    std::uint32_t pick(std::uint32_t n) override {
        std::size_t bytes = n <= 0x100u ? 1 : (n <= 0x10000u ? 2 : 4);
        std::uint32_t v = 0;
        for (std::size_t i = 0; i < bytes; ++i)
            v = (v << 8) | (pos_ < size_ ? data_[pos_++] : 0u);
        if (pos_ >= size_)
            ended_ = true;
        return v % n;
    }
    bool exhausted() const override { return ended_; }

  private:
    const std::uint8_t* data_;
    std::size_t size_;
    std::size_t pos_ = 0;
    bool ended_ = false;
};

struct ProgramOptions {
    int maxTables = 7;
    int maxCursors = 10;
    bool allowReset = true;
    // Percent of new cursors made as read cursors.
    int readerPercent = 30;
    // Share (percent) of inserts among the cursor actions.
    int insertPercent = 35;
    // Data: `bigPercent` percent of the records are big (bigMin..bigMax bytes), the rest 0..29.
    int bigPercent = 5;
    std::uint32_t bigMin = 3000;
    std::uint32_t bigMax = 6000;
    // Keys from a wide space (8..23 bytes, integers over the whole range), so that tables grow
    // instead of replacing a few hundred keys.
    bool wideKeys = false;
    // Out-of-range table kinds and the key forms that do not match a table's kind.
    bool oddInputs = false;
    // Percent of the table destructions drawn that are made (fewer: tables grow big).
    int destroyTablePercent = 100;
    // Destroy a table only when no cursor made on it is left (the order the store asks for).
    bool cursorsBeforeTables = false;
    // Copies of the pager taken, assigned back (and assigned to), reset() called through a copy.
    // The model does not follow the store from the first assignment back or reset through a
    // copy: from then on the program only drives the store (no crash, no sanitizer report is
    // what is asked).
    bool pagerCopies = false;
    // Faults: see above. Null means no faults.
    std::function<std::uint64_t()> faultEvents;
    std::function<bool()> faultsArmed;
    // Prints every step's action (to find what led to a mismatch).
    bool trace = false;
    // Called after a table creation opened a fresh engine.
    std::function<void()> onEngineOpened;
    // How the engines the program opens gather their loads (engine/btree.h, Loads): in force
    // from the program's construction to its destruction.
    kov::engine::LoadLimits loads = kov::engine::kDefaultLoadLimits;
};

// The options of a store fuzz target's input (tests/fuzz/store_fuzz.cpp) from its first byte:
// bit 0 set = tables are destroyed only after their cursors (the order the store asks for);
// bit 1 set = some records are a few KB long; bit 2 set = pager copies; bit 3 set = a load
// buffer of about 1 KiB, gathered from the second insert after a read, and three cursor actions
// in four inserts (runs and merges within a few dozen inserts).
inline ProgramOptions fuzzVariant(std::uint8_t variant) {
    ProgramOptions options;
    options.oddInputs = true;
    options.cursorsBeforeTables = (variant & 1) != 0;
    options.bigPercent = (variant & 2) != 0 ? 5 : 0;
    options.pagerCopies = (variant & 4) != 0;
    if ((variant & 8) != 0) {
        options.loads = kov::engine::test::kTinyLoads;
        options.insertPercent = 75;
    }
    return options;
}

// What a resync found in each model table, summed over the run.
struct FaultReport {
    std::uint64_t faultedSteps = 0;    // steps during which a fault was injected
    std::uint64_t faultedWithGathered = 0;  // of those, steps begun with entries gathered
    std::uint64_t resyncs = 0;         // times the model was set from the engine
    std::uint64_t tablesIntact = 0;    // read back exactly as the model had them
    std::uint64_t tablesLostSome = 0;  // read back without error, some acknowledged entries missing
    std::uint64_t tablesChanged = 0;   // read back without error with entries the model lacks
    std::uint64_t tablesBroken = 0;    // read back with an error (SQLITE_CORRUPT, ...)
    std::uint64_t entriesLost = 0;     // acknowledged entries missing or changed, in all tables
    std::uint64_t refusedInsertsDropped = 0;  // faulted inserts that left nothing (the no-op)
    std::uint64_t refusedInsertsStored = 0;   // faulted inserts whose entry is there after all
    std::uint64_t damagedButReadable = 0;     // resyncs where every table read back but the
                                              // engine's consistency check failed
    std::vector<std::string> faultedActions;  // the first few faulted steps' actions
    // What load work (see LoadReport) each of those steps did, when the model knows it: "run",
    // "append" (a buffer appended to its table when memory ran out), "merge", space-separated;
    // empty for none.
    std::vector<std::string> faultedLoadWork;
    // Loads, when a fault ended the writes: every table is compared with what the model knows
    // was merged into it (inserted before its last read, or inserted straight); what was still
    // gathered is lost. A table merged during the faulted step may hold any part of that merge.
    std::uint64_t tablesAsMerged = 0;     // read back as merged, nothing more, nothing less
    std::uint64_t tablesNotAsMerged = 0;  // read back without error, but not as merged
    std::uint64_t tablesUncertain = 0;    // the model could not tell what was merged (below)
    std::uint64_t entriesLostGathered = 0;  // entries lost that were still gathered
    std::uint64_t entriesLostMerged = 0;    // merged entries missing or changed
};

// Loads (engine/btree.h): the model follows the engine's rule for every table (which inserts are
// gathered, which buffer is written out when the load memory is full and whether it is appended
// or becomes a run, which operations read a table and merge what it gathered) and checks the
// engine's load statistics against it after every checked step. Summed over the run:
struct LoadReport {
    kov::engine::LoadStats engine;  // the engine's own, summed over the engines the program opened
    std::uint64_t statsChecked = 0;      // steps whose load statistics matched the model's
    std::uint64_t readsBetweenInserts = 0;   // reads of a table inserted into since its last read
    std::uint64_t mergesByInserts = 0;       // merges of gathered entries by inserts in key order
    std::uint64_t mergesOverEqualKeys = 0;   // merges of runs of which two hold an equal key
    std::uint64_t createdWithPending = 0;    // tables created while entries were gathered
    std::uint64_t resetsWithPending = 0;     // resets made while entries were gathered
    std::uint64_t destroyedWithPending = 0;  // tables destroyed with entries gathered
    // Buffers written out while two tables held equally many bytes: which one went first is the
    // engine's choice, so the model stops checking the statistics, and what is merged into the
    // tables concerned, until each of them is read.
    std::uint64_t ambiguousSpills = 0;
};

inline void addLoads(kov::engine::LoadStats& sum, const kov::engine::LoadStats& s) {
    sum.gathered += s.gathered;
    sum.runsWritten += s.runsWritten;
    sum.merges += s.merges;
    sum.mergedByAppend += s.mergedByAppend;
    sum.insertsAfterSearch += s.insertsAfterSearch;
}
inline void addLoads(LoadReport& sum, const LoadReport& r) {
    addLoads(sum.engine, r.engine);
    sum.statsChecked += r.statsChecked;
    sum.readsBetweenInserts += r.readsBetweenInserts;
    sum.mergesByInserts += r.mergesByInserts;
    sum.mergesOverEqualKeys += r.mergesOverEqualKeys;
    sum.createdWithPending += r.createdWithPending;
    sum.resetsWithPending += r.resetsWithPending;
    sum.destroyedWithPending += r.destroyedWithPending;
    sum.ambiguousSpills += r.ambiguousSpills;
}

class StoreProgram {
  public:
    StoreProgram(ChoiceSource& choices, ProgramOptions options);
    ~StoreProgram();
    StoreProgram(const StoreProgram&) = delete;
    StoreProgram& operator=(const StoreProgram&) = delete;

    // Starts from an empty registry and a closed engine, runs up to `steps` steps (or until the
    // choices run out), then destroys every host object (cursors first) and empties the registry.
    void run(int steps);

    // The same in pieces, for callers that arm faults between steps.
    void begin();
    void step();
    void end();

    std::uint64_t steps() const;
    std::uint64_t operations() const;
    // Answers that differ from the model.
    std::uint64_t mismatches() const;
    // True once a fault ended the engine's write transaction: it refuses writes until a reset
    // opens a fresh one.
    bool writesRefused() const;
    const std::vector<std::string>& mismatchTexts() const;
    std::string firstMismatch() const;
    const FaultReport& faultReport() const;
    const LoadReport& loadReport() const;
    bool stopped() const;
    // Bytes of data the model holds (what the store should hold).
    std::uint64_t modelBytes() const;
    bool dirty() const;
    // The options, for callers that change the mix between steps (hooks excepted).
    ProgramOptions& options();
    // True after a resync found a damaged table: nothing is checked until the next reset.
    bool degraded() const;
    // A reset made by the caller, as the host would (between steps).
    void forceReset();

  private:
    class Impl;  // store_program.cpp
    std::unique_ptr<Impl> impl_;
};

}  // namespace kovtest

#endif  // KOVPAGER_TESTS_STORE_PROGRAM_H
