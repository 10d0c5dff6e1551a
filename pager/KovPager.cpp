// The pager: the singleton that owns the engine, and the cursor registry.
//
// Design notes.
//
// 1. The singleton. instance() holds a guarded function-local static pointer, initialised by
//    create(): create() placement-constructs the pager in static storage and only then registers
//    atExit() with std::atexit, so a constructor that throws registers nothing and the next call
//    of instance() tries again. The pager's lifetime never ends: atExit() runs teardown() but does
//    not destroy the object, so host objects destroyed later still find a valid pager with no
//    engine (and do nothing).
//
// 2. The registry. cursorSlots_ holds one CursorSlot per registered cursor; its rules (the slot
//    states, the invariants) and every change to it are in CursorRegistry (pager/CursorRegistry.h).
//
// 3. Table creation. The engine refuses to create (or drop) a table while any cursor is open, so
//    KovBtree's constructor creates its table through CursorRegistry::createTable: closeAllCursors()
//    (each live cursor's key kept), the creation, restoreAllCursors() (every live slot reopened as a
//    writing cursor on its key).
//
// 4. The temporary directory. tempDir_ is the pager's own copy of the directory; the engine's
//    directory setting points into its buffer from construction until teardown, and operator=
//    on the singleton re-points it after replacing the text. Teardown sets it to null before
//    releasing the buffer; a table made after the teardown (from a later exit-time hook) takes
//    the process's directory again (initialize()), since the engine makes its file only in the
//    directory the setting names, and in no other.
//
// 5. The store's results do not depend on engine status codes: a refusal is a silent no-op.
//    Out-values are initialised before each engine call, so a refused call reads as "no entry".
//    (The one code looked at is that of the zero-byte key read when a cursor's key is kept for a
//    table creation; see CursorRegistry.cpp.)
//    Failures are kept apart from results: the engine keeps its first one, initialize() the
//    failure to open an engine (openFailure_), and failed()/failure() read both.
//
// 6. Who owns the handles. The process's pager is the only owner of the engine and of every
//    engine cursor; copies hold the same handles without owning them. Two ways let a copy
//    reach them later: reset() through a copy closes the shared engine (openEngine() notices,
//    and the pager then counts as closed), and a copy assigned back brings handles that may
//    have been closed since (operator= keeps only what is open now, and closes what nothing
//    holds any more). So every handle the pager uses is open or inert, never freed.
#include <kovpager/KovPager.h>

#include <cstdlib>
#include <new>
#include <unordered_set>

#include "engine/btree.h"
#include "pager/CursorRegistry.h"
#include "tempdir/TempDirectory.h"

namespace eng = kov::engine;

using kov::pager::CursorRegistry;
using kov::pager::CursorSlot;

namespace {

// Storage of the one pager. Static, so it outlives every host object.
alignas(KovPager) unsigned char gPagerStorage[sizeof(KovPager)];

// The constructed pager, or null before the first successful construction.
KovPager* gPager = nullptr;

}  // namespace

const std::int64_t KovPager::defaultPageSize_;
const std::int64_t KovPager::defaultCacheSize_;

KovPager* KovPager::instance() {
    static KovPager* const pager = create();
    return pager;
}

KovPager* KovPager::create() {
    KovPager* pager = new (gPagerStorage) KovPager();
    gPager = pager;
    std::atexit(&KovPager::atExit);
    return pager;
}

void KovPager::atExit() {
    if (gPager != nullptr)
        gPager->teardown();
}

KovPager::KovPager() : engine_(nullptr), openFailure_(0) {
    const std::string dir = kov::getTempDirectory();
    tempDir_.assign(dir.c_str());  // up to the first NUL
    eng::temporaryDirectorySetting() = tempDir_.data();
    initialize();
}

KovPager::~KovPager() {
    teardown();
}

KovPager::KovPager(const KovPager& other)
    : engine_(other.engine_),
      cursorSlots_(other.cursorSlots_),
      tempDir_(other.tempDir_),
      openFailure_(other.openFailure_) {}

KovPager& KovPager::operator=(const KovPager& other) {
    if (this == &other)
        return *this;
    if (this != gPager) {
        // A copy holds plain data; nothing of it is used until it is assigned back.
        engine_ = other.engine_;
        cursorSlots_ = other.cursorSlots_;
        tempDir_ = other.tempDir_;
        openFailure_ = other.openFailure_;
        return *this;
    }
    // The process's pager takes only what is still open (see the header): a copy may be older
    // than the engine and the cursors it names.
    eng::Btree* incoming = other.engine_;
    if (incoming != nullptr && !eng::sqlite3BtreeIsOpen(incoming))
        incoming = openEngine();  // closed since the copy was taken: keep ours
    if (incoming != openEngine())
        closeEngine();  // no pager would ever close it otherwise
    engine_ = incoming;

    // Each engine cursor this registry holds now may go to one slot of the new registry; the
    // ones no slot takes are closed.
    std::vector<CursorSlot> slots = other.cursorSlots_;
    std::unordered_set<eng::BtCursor*> held;
    for (const CursorSlot& slot : cursorSlots_) {
        if (slot.cursor != nullptr)
            held.insert(slot.cursor);
    }
    for (CursorSlot& slot : slots) {
        if (slot.cursor != nullptr && held.erase(slot.cursor) == 0)
            slot.cursor = nullptr;
    }
    for (eng::BtCursor* orphan : held)
        eng::sqlite3BtreeCloseCursor(orphan);
    cursorSlots_ = std::move(slots);
    CursorRegistry::check(cursorSlots_);

    tempDir_ = other.tempDir_;
    openFailure_ = other.openFailure_;
    // The engine reads the setting each time it names a file: never leave it dangling.
    eng::temporaryDirectorySetting() = tempDir_.data();
    return *this;
}

void KovPager::reset() {
    closeEngine();
    openFailure_ = 0;
}

eng::Btree* KovPager::openEngine() {
    if (engine_ != nullptr && !eng::sqlite3BtreeIsOpen(engine_))
        engine_ = nullptr;
    return engine_;
}

void KovPager::closeEngine() {
    if (openEngine() != nullptr)
        eng::sqlite3BtreeClose(engine_);
    engine_ = nullptr;
}

void KovPager::initialize() {
    closeEngine();
    if (eng::temporaryDirectorySetting() == nullptr) {
        // Only after the exit-time teardown, which let the directory go with the registry: a
        // store used after it (from a later exit-time hook) takes the process's directory again,
        // so that its file still goes there, the only place it may go.
        const std::string dir = kov::getTempDirectory();
        tempDir_.assign(dir.c_str());
        eng::temporaryDirectorySetting() = tempDir_.data();
    }
    int rc = eng::sqlite3BtreeOpen(nullptr, nullptr, &engine_,
                                   eng::BTREE_OMIT_JOURNAL | eng::BTREE_NO_READLOCK);
    // Every step is made, whatever the one before gave (the engine refuses what it cannot do
    // on a null handle); the first failure is kept.
    const int steps[] = {
        eng::sqlite3BtreeSetPageSize(engine_, static_cast<int>(defaultPageSize_), -1),
        eng::sqlite3BtreeSetCacheSize(engine_, static_cast<int>(defaultCacheSize_)),
        eng::sqlite3BtreeBeginTrans(engine_, 2),
    };
    for (int step : steps) {
        if (rc == eng::SQLITE_OK)
            rc = step;
    }
    if (rc != eng::SQLITE_OK && openFailure_ == 0)
        openFailure_ = rc;
}

bool KovPager::failed() const {
    if (openFailure_ != 0)
        return true;
    return eng::sqlite3BtreeIsOpen(engine_) &&
           eng::sqlite3BtreeFailure(engine_, nullptr) != eng::SQLITE_OK;
}

std::string KovPager::failure() const {
    int code = openFailure_;
    const char* doing = "opening its engine";
    if (code == 0 && eng::sqlite3BtreeIsOpen(engine_))
        code = eng::sqlite3BtreeFailure(engine_, &doing);
    if (code == 0)
        return std::string();
    std::string text = "The store failed while ";
    text += doing;
    text += ": ";
    text += eng::resultText(code);
    text += " (SQLite result code " + std::to_string(code) + ")";
    // A refusal for room or for the temporary file says what the system said.
    const std::string detail =
        openFailure_ == 0 ? eng::sqlite3BtreeFailureDetail(engine_) : std::string();
    if (!detail.empty())
        text += ": " + detail;
    text += "; temporary directory: ";
    text += tempDir_.empty() ? std::string("none set, the engine's default") : tempDir_;
    text += ".";
    return text;
}

void KovPager::closeAllCursors(std::vector<std::string>& saved) {
    CursorRegistry::closeAll(cursorSlots_, saved);
}

void KovPager::restoreAllCursors(const std::vector<std::string>& saved) {
    CursorRegistry::restoreAll(engine_, cursorSlots_, saved);
}

void KovPager::teardown() {
    closeEngine();
    openFailure_ = 0;
    // Closing the engine left the registered cursors inert; free them.
    for (CursorSlot& slot : cursorSlots_) {
        if (slot.cursor != nullptr)
            eng::sqlite3BtreeCloseCursor(slot.cursor);
        slot.cursor = nullptr;
    }
    if (eng::temporaryDirectorySetting() == tempDir_.data()) {
        eng::temporaryDirectorySetting() = nullptr;
    }
    std::string().swap(tempDir_);
    std::vector<CursorSlot>().swap(cursorSlots_);
}
