// KovPager: the process-wide owner of the store.
//
// There is one KovPager per process. It holds the storage engine (one anonymous temporary database,
// never committed, deleted when the engine closes), the registry of every open cursor, and its own
// copy of the directory in which the engine places its temporary file. A host rarely names it: the
// first KovBtree or KovBtreeCursor brings it into being, and it closes itself when the library is
// unloaded or the process ends.
//
//   KovBtree numbers(KovBtree::IntKeyTable);   // the pager and its engine come into being here
//   KovBtreeCursor out(numbers, true);         // a writing cursor
//   out.insert(42, "answer", 6);
//   ...
//   KovPager::instance()->reset();             // optional: throw every table away at once
//
// Lifetime and ownership:
//   - instance() constructs the pager on its first call (resolving the temporary directory and
//     opening the engine) and registers an exit-time hook; if construction throws, nothing is
//     registered and the next call tries again. The pager is never destroyed before that hook runs.
//   - The exit-time hook (library unload or process end) closes the engine, which discards every
//     table and deletes the temporary file, frees every engine cursor still registered, and empties
//     the registry. The pager object itself stays valid: a host cursor or table destroyed after
//     that finds no engine and does nothing.
//   - reset() closes the engine only. Every table and cursor made before becomes void: destroy
//     them (cursors first) before making new ones. The next KovBtree opens a fresh, empty engine.
//   - Destroy every cursor before its table, and both before calling reset().
//
// Thread safety: the store takes no lock. The first call of instance() is safe from any number of
// threads (all get the same pager, the engine is opened once); everything else must be used from
// one thread at a time.
#ifndef KOVPAGER_KOVPAGER_H
#define KOVPAGER_KOVPAGER_H

#include <cstdint>
#include <string>
#include <vector>

// Marks the three classes of the library's interface. Everything else in the library is hidden.
#if defined(_WIN32)
#if defined(KOVPAGER_BUILDING)
#define KOVPAGER_EXPORT __declspec(dllexport)
#elif defined(KOVPAGER_SHARED)
#define KOVPAGER_EXPORT __declspec(dllimport)
#else
#define KOVPAGER_EXPORT
#endif
#else
#define KOVPAGER_EXPORT __attribute__((visibility("default")))
#endif

// The library's own names, which a host does not use.
namespace kov::engine {
struct Btree;
struct BtCursor;
}  // namespace kov::engine

namespace kov::pager {

class CursorRegistry;

// One registered cursor: the engine cursor, the root page of its table (freeSlot_ marks a free
// slot) and the table's engine flags (bit 0 set: integer keys). The registry's rules are in the
// library's pager/CursorRegistry.h.
struct CursorSlot {
    // The rootPage of a free slot.
    static constexpr std::uint32_t freeSlot_ = 0xFFFFFFFFu;

    kov::engine::BtCursor* cursor;  // null while closed for a table creation, and when free
    std::uint32_t rootPage;         // table the cursor walks; freeSlot_ = free slot
    std::uint32_t tableFlags;       // the table's flags when the cursor was registered
};

}  // namespace kov::pager

class KovBtree;
class KovBtreeCursor;

class KOVPAGER_EXPORT KovPager {
  public:
    // The pager, created on the first call (see above). Never null; throws only what resolving
    // the temporary directory or an allocation throws, and then the next call tries again.
    static KovPager* instance();

    // Closes the engine: every table and every cursor made so far becomes void. The registry is
    // kept as it is; a cursor destroyed while the engine is closed leaves its slot in place, and
    // the next table creation frees what such slots still hold. Calling it twice does nothing more.
    void reset();

    // True once the store has lost or refused data through a failure since its engine opened:
    // the engine could not be opened, the temporary file could not be created, read or written,
    // the disk was full, memory ran out. Cleared by reset(). The refusals the store makes by
    // design (an insert through a read cursor, a key of the wrong form, ...) are not failures.
    // After a failure the store refuses every write until reset(); what reads back stays as it
    // reads (docs/faults.md says what that is for each kind of failure).
    bool failed() const;

    // The first such failure as one sentence for a log: what the store was doing, the engine's
    // message and code, and the temporary directory. Empty while failed() is false. Later
    // failures do not replace the first.
    //
    //   if (KovPager::instance()->failed())
    //       std::fprintf(stderr, "%s\n", KovPager::instance()->failure().c_str());
    std::string failure() const;

    // Copies share the engine handle without owning it. A copy cannot be destroyed (the
    // destructor is private); the library never copies the pager. reset() on a copy closes the
    // engine it shares, as reset() on the process's pager does.
    KovPager(const KovPager& other);

    // Copies the engine handle, the registry and the directory text. When the target is the
    // process's pager, the engine's directory setting follows the new text, and what the copy
    // holds is checked against what is open now: an engine that has been closed since the copy
    // was taken is not taken (the store keeps its engine), an engine that no pager holds any
    // more is closed, a slot whose engine cursor has been closed since gets none (its cursor
    // then answers as on no entry), and an engine cursor that no slot names any more is closed.
    // So no order of calls reaches freed memory; but a copy taken before a table creation or a
    // cursor's destruction does not bring the cursors back where they were.
    KovPager& operator=(const KovPager& other);

  private:
    friend class KovBtree;
    friend class KovBtreeCursor;
    friend class kov::pager::CursorRegistry;
    // The unit tests' window on the private state. Declared here, defined only by the tests; the
    // library neither defines nor exports it.
    friend struct KovTestAccess;

    KovPager();
    ~KovPager();

    // (Re)opens the engine: closes the current one if any, opens a fresh temporary database, sets
    // the page and cache sizes and begins the one exclusive write transaction. A failure is kept
    // (failed()).
    void initialize();

    // The engine handle when its engine is open; otherwise (closed through a copy's reset())
    // null, and engine_ becomes null too.
    kov::engine::Btree* openEngine();

    // Closes the engine if it is open, and forgets the handle. The one place that closes it.
    void closeEngine();

    // Closes every live cursor, saving its position in `saved` (index-aligned with the registry):
    // 8 native-order bytes of the integer key, or the whole byte-string key.
    void closeAllCursors(std::vector<std::string>& saved);

    // Reopens every live cursor (as a writing cursor) and moves it to its saved position.
    void restoreAllCursors(const std::vector<std::string>& saved);

    static KovPager* create();
    static void atExit();
    void teardown();

    kov::engine::Btree* engine_;
    std::vector<kov::pager::CursorSlot> cursorSlots_;
    std::string tempDir_;
    // SQLite's result code when opening the engine failed since the last reset(), else 0.
    int openFailure_;

    static const std::int64_t defaultPageSize_ = 4096;
    static const std::int64_t defaultCacheSize_ = 16384;
};

#endif  // KOVPAGER_KOVPAGER_H
