// The B-tree operations on one connection of the library's private SQLite.
//
// How the operations map onto SQLite:
//
//  * The connection is opened on an empty file name (a private temporary
//    database: the file is made when the cache first spills, unlinked at once
//    on POSIX, removed on close). Its settings (journal, locking, page and
//    cache sizes) are made with pragmas and the transaction is begun with
//    BEGIN, so that the connection itself knows it is inside a transaction
//    and never commits it. Everything after that goes to SQLite's B-tree
//    layer through engine/sqlite_btree.h: a table is a B-tree named by its
//    root page, a cursor is a B-tree cursor, a walk is Next/Previous, a seek
//    is one search, an insert is one B-tree insert.
//
//  * The binding's bookkeeping reproduces the refusals the store relies on,
//    before SQLite is asked anything: create and drop while cursors are open,
//    writers against read cursors, inserts through read cursors, reads past
//    the entry, a null key on a byte-string table, and every write once a
//    failure has ended the write transaction. SQLite's B-tree layer itself
//    checks none of these (it asserts them in debug builds).
//
//  * The binding decides for itself whether a cursor is on an entry
//    (BtCursor::onEntry). After an insert its cursor reports no entry, as the
//    rules say, while SQLite's cursor is left where the insert put it: the
//    next insert through it then often needs no search from the root.
//
// Invariants:
//  1. Every open cursor is on its table's list and counted in
//     Btree::openCursors; a read cursor is counted in Table::readCursors.
//  2. A cursor with onEntry set has an SQLite cursor on an entry of its table
//     (kovsq_valid), and `entry` describes that entry while `described` is set.
//  3. No cursor but the inserting one stands on an entry of a table while
//     SQLite inserts into it (they are all taken off it first).
//  4. An inert cursor (engine closed) has bt == table == cursor == null and
//     onEntry false; it is freed only by sqlite3BtreeCloseCursor.
//  5. Btree::writable is false from the first failure SQLite reports until
//     the engine is closed; every write checks it first. Btree::accepting is
//     false from the first refusal for room or for the file until the engine
//     is closed; every write the host asks for checks it first (merges of
//     what is gathered do not: their room is reserved).
//  6. A table with inserts gathered and not merged (Table::pending) has no
//     cursor on an entry and no read cursor: every read merges them first.
//  7. Btree::gathered is the sum of the bytes of every table's load buffer.
//  8. Btree::pendingBound is the sum of loadBound over every table's pending
//     load.
//
// Debug builds check these with assert (checkEngine, checkCursor) at every
// operation that could break them; release builds compile the checks away.

#include "engine/btree.h"

#include <atomic>
#include <cassert>
#include <cstdint>
#include <cstring>
#include <memory>
#include <new>
#include <string>
#include <unordered_map>
#include <vector>

// The codes engine/btree.h declares with SQLite's names and values, listed once: read here
// before SQLite's header makes those names its macros, and again after, and compared.
#define KOV_SQLITE_CODES(X)                                                                     \
    X(SQLITE_OK) X(SQLITE_ERROR) X(SQLITE_PERM) X(SQLITE_LOCKED) X(SQLITE_NOMEM)                 \
    X(SQLITE_READONLY) X(SQLITE_IOERR) X(SQLITE_CORRUPT) X(SQLITE_FULL) X(SQLITE_TOOBIG)        \
    X(SQLITE_MISUSE) X(SQLITE_TXN_NONE) X(SQLITE_TXN_READ) X(SQLITE_TXN_WRITE)
#define KOV_SQLITE_CODE_VALUE(name) name,
namespace kov::engine {
namespace {
constexpr int kDeclaredCodes[] = {KOV_SQLITE_CODES(KOV_SQLITE_CODE_VALUE)};
}  // namespace
}  // namespace kov::engine

// After engine/btree.h: its result codes share SQLite's macro names.
#include "engine/private_sqlite3.h"
#include "engine/page_cache.h"
#include "engine/sorted_load.h"
#include "engine/sqlite_btree.h"
#include "engine/temp_file.h"

namespace kov::engine {

namespace {

constexpr int kSqliteCodes[] = {KOV_SQLITE_CODES(KOV_SQLITE_CODE_VALUE)};
#undef KOV_SQLITE_CODE_VALUE
#undef KOV_SQLITE_CODES

constexpr bool sameCodes() {
    for (std::size_t i = 0; i < sizeof kSqliteCodes / sizeof kSqliteCodes[0]; ++i) {
        if (kDeclaredCodes[i] != kSqliteCodes[i])
            return false;
    }
    return true;
}
static_assert(sizeof kDeclaredCodes == sizeof kSqliteCodes && sameCodes(),
              "engine/btree.h declares a result code with another value than SQLite's");

// Keys and data beyond SQLite's default length limit are refused.
constexpr std::int64_t kMaxLength = 1000000000;

enum class Transaction { None, Read, Write };

// How loads are gathered (engine/sorted_load.h); TEST_setLoadLimits changes it for the engines
// opened after.
LoadLimits gLoadLimits = kDefaultLoadLimits;

}  // namespace

struct Table {
    std::uint32_t root = 0;
    bool intKey = false;
    bool hasData = true;
    BtCursor* cursors = nullptr;  // open cursors, a list
    int readCursors = 0;
    // Inserts since the table was last read; past LoadLimits::directInserts they are gathered.
    std::uint32_t insertsSinceRead = 0;
    std::unique_ptr<PendingLoad> pending;  // what is gathered and not merged; null when nothing

    TableShape shape() const { return TableShape{intKey, hasData}; }
};

struct Btree {
    sqlite3* db = nullptr;
    KovsqTree* tree = nullptr;
    std::unordered_map<std::uint32_t, std::unique_ptr<Table>> tables;
    int openCursors = 0;
    Transaction transaction = Transaction::None;
    bool writable = true;  // false once a failure ended the write transaction
    bool accepting = true;  // false once a write was refused for room or for the file
    int failureCode = SQLITE_OK;  // SQLite's extended code of that failure
    const char* failureOperation = "";  // what the engine was doing then
    std::string failureDetail;  // the system's words, for a refusal
    Btree* nextOpen = nullptr;  // the list of open engines
    bool pageSizeFixed = false;
    LoadLimits limits = kDefaultLoadLimits;
    std::size_t gathered = 0;  // bytes held by the load buffers of every table
    std::uint64_t pendingBound = 0;  // bytes the pending loads may still take in the file
    // Run B-trees: every one made (for the integrity check), and the empty ones ready for the
    // next run, by layout ([1] integer keys).
    std::vector<std::uint32_t> runTrees;
    std::vector<std::uint32_t> freeRuns[2];
    LoadStats stats;
};

struct BtCursor {
    Btree* bt = nullptr;
    Table* table = nullptr;
    KovsqCursor* cursor = nullptr;
    bool write = false;
    bool onEntry = false;
    bool described = false;
    // Where the last move, a search, left SQLite's cursor for an insert of the key it searched
    // (a KOVSQ_ position; KOVSQ_SEARCH when the cursor has moved since, or cannot tell).
    int seekAt = KOVSQ_SEARCH;
    std::int64_t seekIntKey = 0;
    std::string seekKey;
    KovsqEntry entry{};
    std::string keyCopy;   // a key that does not lie whole on its page
    std::string dataCopy;  // data that does not lie whole on its page
    BtCursor* prev = nullptr;  // neighbours on the table's list
    BtCursor* next = nullptr;
};

namespace {

// --- Space ---
//
// Room in the temporary file is reserved ahead of the pages the engine holds (engine/temp_file.h,
// engine/sqlite_btree.h), so that writing out a page the cache holds never meets a full disk:
// a full disk refuses the write that would need more room, and loses nothing. Before each insert
// the engine makes sure of room for every page the database holds, for what every gathered load
// may still take when it is written out in runs and merged (its bound, below), and for the entry
// itself. Bounds are generous; when the room for them is not there, every load is merged first
// (it then takes what it needs, not its bound) and room asked for again. Only then is the insert
// refused: SQLITE_FULL (or SQLITE_CANTOPEN when the file could not be made), kept as the
// engine's failure; from then on every write the host asks for is refused, while the merges of
// what was gathered, whose room is held, go on at the next read of their tables.

// A load's bound in quarters of its entries' page bytes: a run is packed by appending (5/4, for
// interior pages and part-filled pages); a merge into an empty table appends the same way (5/4),
// a merge into a table that holds entries inserts, which can leave split pages half full (10/4).
constexpr std::uint64_t kRunQuarters = 5;
constexpr std::uint64_t kAppendQuarters = 5;
constexpr std::uint64_t kInsertQuarters = 10;
// Room for new tree levels and run trees, per load and per insert.
constexpr std::uint64_t kSlackBytes = std::uint64_t{256} << 10;

std::uint64_t loadBound(const PendingLoad& load) {
    const std::uint64_t merge = load.mergeAppends ? kAppendQuarters : kInsertQuarters;
    return (load.bufferBound * (kRunQuarters + merge) + load.runBound * merge) / 4 + kSlackBytes;
}

// Invariants 2 and 4 for one cursor.
void checkCursor(const BtCursor* cur) {
    if (cur->bt == nullptr) {
        assert(cur->table == nullptr && cur->cursor == nullptr && !cur->onEntry);
        return;
    }
    assert(cur->table != nullptr && cur->cursor != nullptr);
    assert(!cur->onEntry || kovsq_valid(cur->cursor));
    assert(!cur->described || cur->onEntry);
    (void)cur;
}

// Invariants 1, 2 and 5 for a whole engine (a walk over its cursors).
void checkEngine(const Btree* bt) {
#ifndef NDEBUG
    int open = 0;
    std::size_t gathered = 0;
    std::uint64_t bound = 0;
    for (const auto& entry : bt->tables) {
        const Table* t = entry.second.get();
        assert(t->root == entry.first);
        int readers = 0;
        for (const BtCursor* c = t->cursors; c != nullptr; c = c->next) {
            assert(c->bt == bt && c->table == t);
            assert(c->next == nullptr || c->next->prev == c);
            checkCursor(c);
            assert(t->pending == nullptr || !c->onEntry);  // invariant 6
            readers += c->write ? 0 : 1;
            ++open;
        }
        assert(readers == t->readCursors);
        assert(t->pending == nullptr || t->readCursors == 0);  // invariant 6
        gathered += t->pending != nullptr ? t->pending->buffer.bytes() : 0;
        bound += t->pending != nullptr ? loadBound(*t->pending) : 0;
    }
    assert(open == bt->openCursors);
    assert(gathered == bt->gathered);  // invariant 7
    assert(bound == bt->pendingBound);  // invariant 8
    assert((bt->writable && bt->accepting) || bt->failureCode != SQLITE_OK);
#else
    (void)bt;
#endif
}

int exec(sqlite3* db, const char* sql) { return sqlite3_exec(db, sql, nullptr, nullptr, nullptr); }

bool isFailure(int rc) { return rc != SQLITE_OK && rc != SQLITE_DONE; }

// A failure reported by SQLite ends the write transaction for good: with no
// journal, nothing undoes what a failed write may have left half-done. The
// binding answers with the primary result code (SQLITE_IOERR for every kind
// of I/O error); the first failure's extended code is kept, with what the
// engine was doing.
int noteFailure(Btree* bt, int rc, const char* operation) {
    if (!isFailure(rc))
        return rc;
    if (bt->writable) {
        bt->failureCode = rc;
        bt->failureOperation = operation;
    }
    bt->writable = false;
    return rc & 0xff;
}

// A write refused for room or because the file could not be made changed nothing: the host's
// writes are refused from now on, and nothing is lost (the merges of what was gathered go on).
int noteRefusal(Btree* bt, int rc, const char* operation) {
    if (bt->failureCode == SQLITE_OK) {
        bt->failureCode = rc;
        bt->failureOperation = operation;
        bt->failureDetail = lastTemporaryFileError();
        if (bt->failureDetail.empty())
            bt->failureDetail = (rc & 0xff) == SQLITE_CANTOPEN
                                    ? "the temporary file could not be made"
                                    : "no room could be reserved for the temporary file";
    }
    bt->accepting = false;
    return rc & 0xff;
}

// A failed write: a refusal (kovsq_refused) or a failure.
int noteWriteFailure(Btree* bt, int rc, const char* operation) {
    if (isFailure(rc) && kovsq_refused(bt->tree))
        return noteRefusal(bt, rc, operation);
    return noteFailure(bt, rc, operation);
}

constexpr const char* kMoving = "moving a cursor";
constexpr const char* kReading = "reading an entry";

// The engines open now, a list through Btree::nextOpen. A handle can outlive
// its engine in the hands of a pager copy; this is how the pager tells. A
// plain pointer, so that it is still there for host objects destroyed at exit
// after every static object. (One thread at a time, as everywhere in the
// engine.)
Btree* gOpenEngines = nullptr;

void leaveEntry(BtCursor* cur) {
    cur->onEntry = false;
    cur->described = false;
    cur->seekAt = KOVSQ_SEARCH;
}

// The cursor after a move that returned `rc`: on an entry exactly when the
// move succeeded and SQLite's cursor stands on one. A failed move leaves the
// cursor on no entry.
int afterMove(BtCursor* cur, int rc) {
    cur->described = false;
    cur->seekAt = KOVSQ_SEARCH;
    if (isFailure(rc)) {
        kovsq_clear(cur->cursor);
        cur->onEntry = false;
        return noteFailure(cur->bt, rc, kMoving);
    }
    cur->onEntry = kovsq_valid(cur->cursor) != 0;
    checkCursor(cur);
    return rc;
}

// The current entry, described once per position.
int describe(BtCursor* cur) {
    if (cur->described)
        return SQLITE_OK;
    int rc = kovsq_entry(cur->cursor, &cur->entry);
    if (rc != SQLITE_OK)
        return noteFailure(cur->bt, rc, kReading);
    cur->described = true;
    return SQLITE_OK;
}

// Lengths of the current entry's key (0 on integer-keyed tables) and data;
// both 0 on no entry or when the entry cannot be read.
void entryLengths(BtCursor* cur, std::uint64_t* keyLen, std::uint64_t* dataLen) {
    *keyLen = 0;
    *dataLen = 0;
    if (cur->onEntry && describe(cur) == SQLITE_OK) {
        *keyLen = cur->entry.keySize;
        *dataLen = cur->entry.dataSize;
    }
}

// Copies payload bytes [offset, offset+amt) of the current entry: from the
// page when they lie on it, else through SQLite (overflow pages).
int copyPayload(BtCursor* cur, std::uint32_t offset, std::uint32_t amt, void* out) {
    if (std::uint64_t{offset} + amt <= cur->entry.localSize) {
        std::memcpy(out, cur->entry.local + offset, amt);
        return SQLITE_OK;
    }
    return noteFailure(cur->bt, kovsq_read(cur->cursor, offset, amt, out), kReading);
}

void link(BtCursor* cur) {
    Table* t = cur->table;
    cur->prev = nullptr;
    cur->next = t->cursors;
    if (t->cursors != nullptr)
        t->cursors->prev = cur;
    t->cursors = cur;
    if (!cur->write)
        ++t->readCursors;
    ++cur->bt->openCursors;
}

void unlink(BtCursor* cur) {
    Table* t = cur->table;
    if (cur->prev != nullptr) {
        cur->prev->next = cur->next;
    } else {
        t->cursors = cur->next;
    }
    if (cur->next != nullptr)
        cur->next->prev = cur->prev;
    cur->prev = cur->next = nullptr;
    if (!cur->write)
        --t->readCursors;
    --cur->bt->openCursors;
}

// The refusals of a byte-string key (rules 2 and 6).
int checkByteKey(const void* pKey, std::int64_t nKey) {
    if (pKey == nullptr)
        return SQLITE_CORRUPT;
    if (nKey < 0)
        return SQLITE_ERROR;
    if (nKey > kMaxLength)
        return SQLITE_TOOBIG;
    return SQLITE_OK;
}

bool validPageSize(int size) { return size >= 512 && size <= 32768 && (size & (size - 1)) == 0; }

// --- Loads (engine/sorted_load.h) ---

constexpr const char* kInserting = "inserting an entry";

// Keys longer than this are not remembered for the insert after a search (it searches again).
constexpr std::int64_t kRememberedKeyLimit = 1024;

// An empty run tree of the given layout: one kept from an earlier run, or a new one.
int takeRunTree(Btree* bt, bool intKey, std::uint32_t* root) {
    std::vector<std::uint32_t>& pool = bt->freeRuns[intKey ? 1 : 0];
    if (!pool.empty()) {
        *root = pool.back();
        pool.pop_back();
        return SQLITE_OK;
    }
    int rc = kovsq_create_table(bt->tree, root, intKey ? 1 : 0);
    if (rc == SQLITE_OK)
        bt->runTrees.push_back(*root);
    return rc;
}

// Empties the load's run trees and keeps them for later runs. After a failure nothing is written
// any more: the trees keep what they hold, unused.
void releaseRuns(Btree* bt, PendingLoad& load, bool intKey) {
    for (std::uint32_t root : load.runs) {
        if (!bt->writable)
            break;
        int rc = noteFailure(bt, kovsq_clear_table(bt->tree, root), kInserting);
        if (rc == SQLITE_OK)
            bt->freeRuns[intKey ? 1 : 0].push_back(root);
    }
    load.runs.clear();
}

// Takes what the table has gathered away from it, and its buffer out of the engine's count.
std::unique_ptr<PendingLoad> takePending(Btree* bt, Table* t) {
    std::unique_ptr<PendingLoad> load = std::move(t->pending);
    if (load != nullptr) {
        bt->gathered -= load->buffer.bytes();
        bt->pendingBound -= loadBound(*load);
    }
    return load;
}

// Keeps invariant 8 while a pending load changes: its bound leaves the engine's sum when made and
// comes back, as it is then, when destroyed.
class BoundChange {
  public:
    BoundChange(Btree* bt, const PendingLoad& load) : bt_(bt), load_(load) {
        bt_->pendingBound -= loadBound(load_);
    }
    ~BoundChange() { bt_->pendingBound += loadBound(load_); }
    BoundChange(const BoundChange&) = delete;
    BoundChange& operator=(const BoundChange&) = delete;

  private:
    Btree* bt_;
    const PendingLoad& load_;
};

// The pages the file must have room for: every page held, and what the pending loads' bounds
// and `extraBytes` more may add beyond the free pages (which new pages take first).
std::int64_t pagesWanted(const Btree* bt, std::uint64_t extraBytes) {
    KovsqSpace space{};
    kovsq_space(bt->tree, &space);
    const std::uint64_t grow =
        (bt->pendingBound + extraBytes + space.usableSize - 1) / space.usableSize;
    return static_cast<std::int64_t>(space.pages +
                                     (grow > space.freePages ? grow - space.freePages : 0));
}

// Merges a load (its buffer sorted) into its table's B-tree and counts the merge.
int merge(Btree* bt, Table* t, const PendingLoad& load) {
    bool appended = false;
    int rc = mergeInto(bt->tree, t->root, t->shape(), load.runs, load.buffer, &appended);
    if (rc == SQLITE_OK) {
        ++bt->stats.merges;
        bt->stats.mergedByAppend += appended ? 1 : 0;
    }
    return rc;
}

// Merges what the table has gathered into its B-tree. After a failure (now or before) what was
// gathered is lost.
int mergePending(Btree* bt, Table* t) {
    std::unique_ptr<PendingLoad> load = takePending(bt, t);
    if (load == nullptr)
        return SQLITE_OK;
    if (!bt->writable)
        return SQLITE_ERROR;
    load->buffer.sortUnique();
    int rc = merge(bt, t, *load);
    if (rc != SQLITE_OK)
        return noteFailure(bt, rc, kInserting);
    releaseRuns(bt, *load, t->intKey);
    // The room held for this load's bound is spent: what is still wanted is the other loads'.
    kovsq_release(bt->tree, pagesWanted(bt, kSlackBytes));
    return SQLITE_OK;
}

// The table is about to be read: what it has gathered goes into its B-tree first. A failure is
// kept (sqlite3BtreeFailure); the read goes on with what the B-tree holds.
void settle(Btree* bt, Table* t) {
    t->insertsSinceRead = 0;
    mergePending(bt, t);
}

// Asks for room for every page held, every pending load's bound and `extraBytes` more.
int reserveFor(Btree* bt, std::uint64_t extraBytes) {
    clearTemporaryFileError();  // what the system says about this attempt, nothing older
    return kovsq_reserve(bt->tree, pagesWanted(bt, extraBytes));
}

// Makes sure of room before a write the host asked for ("Space" above): merges every pending
// load when the room for their bounds is not there, and refuses the write when the room is not
// there even then.
int ensureSpace(Btree* bt, std::uint64_t extraBytes, const char* operation) {
    int rc = reserveFor(bt, extraBytes);
    if (rc != SQLITE_OK && bt->pendingBound > 0) {
        for (const auto& entry : bt->tables) {
            if (mergePending(bt, entry.second.get()) != SQLITE_OK)
                return SQLITE_ERROR;  // a failure, kept: writes stop
        }
        rc = reserveFor(bt, extraBytes);
    }
    return rc == SQLITE_OK ? SQLITE_OK : noteRefusal(bt, rc, operation);
}

// Makes room in the engine's load memory: the largest buffer is written out as a run.
int spillLargest(Btree* bt) {
    Table* largest = nullptr;
    for (const auto& entry : bt->tables) {
        Table* t = entry.second.get();
        if (t->pending != nullptr &&
            (largest == nullptr || t->pending->buffer.bytes() > largest->pending->buffer.bytes()))
            largest = t;
    }
    if (largest == nullptr || largest->pending->buffer.empty())
        return SQLITE_OK;
    PendingLoad& load = *largest->pending;
    BoundChange change(bt, load);
    // A load that arrives in key order, with no run before it, goes into the table now by
    // appending when its keys all lie above the table's: it is written once, not twice. (A load
    // in random order goes into runs even when the table is empty, so that the merge can append
    // all of it: the table's pages are then filled, not split.)
    const bool arrivedInOrder = load.buffer.sorted();
    load.buffer.sortUnique();
    bool appends = false;
    int rc = SQLITE_OK;
    if (load.runs.empty() && arrivedInOrder)
        rc = appendsToTable(bt->tree, largest->root, largest->shape(), load.buffer, &appends);
    if (rc == SQLITE_OK && appends) {
        rc = merge(bt, largest, load);
        load.mergeAppends = false;  // the table holds entries now
    } else if (rc == SQLITE_OK) {
        std::uint32_t root = 0;
        rc = takeRunTree(bt, largest->intKey, &root);
        if (rc == SQLITE_OK) {
            load.runs.push_back(root);
            rc = writeRun(bt->tree, root, largest->shape(), load.buffer);
            ++bt->stats.runsWritten;
        }
        load.runBound += load.bufferBound;
    }
    bt->gathered -= load.buffer.bytes();
    load.buffer.clear();
    load.bufferBound = 0;
    return noteFailure(bt, rc, kInserting);
}

// Gathers one insert into the table's buffer, making room first when the engine's load memory is
// full.
int gather(Btree* bt, Table* t, const void* pKey, std::int64_t nKey, const void* pData,
           std::uint32_t dataSize, std::uint64_t bound) {
    const std::uint32_t keySize = t->intKey ? 0 : static_cast<std::uint32_t>(nKey);
    const std::size_t need = LoadBuffer::footprint(keySize, dataSize);
    if (bt->gathered + need > bt->limits.bufferBytes) {
        int rc = spillLargest(bt);
        if (rc != SQLITE_OK)
            return rc;
    }
    if (t->pending == nullptr) {
        bool empty = false;
        int rc = tableIsEmpty(bt->tree, t->root, t->shape(), &empty);
        if (rc != SQLITE_OK)
            return noteFailure(bt, rc, kInserting);
        try {
            t->pending = std::make_unique<PendingLoad>(t->intKey);
        } catch (const std::bad_alloc&) {
            return noteFailure(bt, SQLITE_NOMEM, kInserting);
        }
        t->pending->mergeAppends = empty;
        bt->pendingBound += loadBound(*t->pending);
    }
    try {
        BoundChange change(bt, *t->pending);
        t->pending->buffer.add(nKey, pKey, keySize, pData, dataSize);
        t->pending->bufferBound += bound;
    } catch (const std::bad_alloc&) {
        return noteFailure(bt, SQLITE_NOMEM, kInserting);
    }
    bt->gathered += need;
    ++bt->stats.gathered;
    return SQLITE_OK;
}

// Remembers where a search for a key left the cursor, for an insert of that key.
void rememberSeek(BtCursor* cur, const void* pKey, std::int64_t nKey, int at) {
    if (cur->table->intKey) {
        cur->seekIntKey = nKey;
    } else if (nKey <= kRememberedKeyLimit) {
        cur->seekKey.assign(static_cast<const char*>(pKey), static_cast<std::size_t>(nKey));
    } else {
        return;
    }
    cur->seekAt = at;
}

// Where an insert of this key through this cursor goes without searching again: next to where
// the cursor's last search left it, when nothing moved it since and the key is the one searched.
int rememberedPosition(const BtCursor* cur, const void* pKey, std::int64_t nKey) {
    if (!cur->onEntry || cur->seekAt == KOVSQ_SEARCH)
        return KOVSQ_SEARCH;
    const bool same = cur->table->intKey
                          ? cur->seekIntKey == nKey
                          : static_cast<std::int64_t>(cur->seekKey.size()) == nKey &&
                                (nKey == 0 || std::memcmp(cur->seekKey.data(), pKey,
                                                          static_cast<std::size_t>(nKey)) == 0);
    return same ? cur->seekAt : KOVSQ_SEARCH;
}

}  // namespace

LoadStats TEST_loadStats(Btree* p) { return p == nullptr ? LoadStats{} : p->stats; }

LoadLimits TEST_setLoadLimits(LoadLimits limits) {
    LoadLimits previous = gLoadLimits;
    gLoadLimits = limits;
    return previous;
}

char*& temporaryDirectorySetting() { return *kovsq_temp_directory(); }

sqlite3* TEST_connection(Btree* p) { return p == nullptr ? nullptr : p->db; }

std::int64_t TEST_pragmaValue(Btree* p, const char* pragma) {
    sqlite3_stmt* stmt = nullptr;
    std::int64_t value = -1;
    if (p != nullptr && sqlite3_prepare_v2(p->db, pragma, -1, &stmt, nullptr) == SQLITE_OK &&
        sqlite3_step(stmt) == SQLITE_ROW) {
        value = sqlite3_column_int64(stmt, 0);
    }
    sqlite3_finalize(stmt);
    return value;
}

namespace {
std::atomic<std::uint64_t> gEnginesOpened{0};
}  // namespace

std::uint64_t TEST_enginesOpened() { return gEnginesOpened.load(); }

int sqlite3BtreeOpen(const char* filename, sqlite3* db, Btree** ppBtree, int flags) {
    if (ppBtree == nullptr)
        return SQLITE_MISUSE;
    *ppBtree = nullptr;
    if (filename != nullptr || db != nullptr)
        return SQLITE_MISUSE;

    auto bt = std::make_unique<Btree>();
    // Before SQLite initialises (engine/page_cache.h), and before the connection picks its file
    // layer (engine/temp_file.h).
    installTemporaryFiles();
    int rc = sqlite3_open_v2("", &bt->db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
    if (rc == SQLITE_OK && (flags & BTREE_OMIT_JOURNAL) != 0)
        rc = exec(bt->db, "PRAGMA journal_mode=OFF");
    if (rc == SQLITE_OK && (flags & BTREE_NO_READLOCK) != 0)
        rc = exec(bt->db, "PRAGMA locking_mode=EXCLUSIVE");
    if (rc == SQLITE_OK)
        rc = exec(bt->db, "PRAGMA synchronous=OFF");
    if (rc == SQLITE_OK) {
        bt->tree = kovsq_tree_open(bt->db);
        if (bt->tree == nullptr)
            rc = SQLITE_NOMEM;
    }
    if (rc != SQLITE_OK) {
        sqlite3_close(bt->db);
        return rc;
    }
    bt->limits = gLoadLimits;
    bt->nextOpen = gOpenEngines;
    gOpenEngines = bt.get();
    *ppBtree = bt.release();
    ++gEnginesOpened;
    return SQLITE_OK;
}

bool sqlite3BtreeIsOpen(Btree* p) {
    for (Btree* e = gOpenEngines; e != nullptr; e = e->nextOpen) {
        if (e == p)
            return p != nullptr;
    }
    return false;
}

int sqlite3BtreeFailure(Btree* p, const char** operation) {
    if (p == nullptr)
        return SQLITE_MISUSE;
    if (operation != nullptr)
        *operation = p->failureOperation;
    return p->failureCode;
}

std::string sqlite3BtreeFailureDetail(Btree* p) { return p == nullptr ? "" : p->failureDetail; }

bool sqlite3BtreeFailureWasRefusal(Btree* p) {
    return p != nullptr && p->failureCode != SQLITE_OK && p->writable;
}

const char* resultText(int code) { return sqlite3_errstr(code); }

int sqlite3BtreeClose(Btree* p) {
    if (p == nullptr)
        return SQLITE_MISUSE;
    checkEngine(p);
    for (Btree** link = &gOpenEngines; *link != nullptr; link = &(*link)->nextOpen) {
        if (*link == p) {
            *link = p->nextOpen;
            break;
        }
    }
    for (auto& entry : p->tables) {
        Table* t = entry.second.get();
        for (BtCursor* cur = t->cursors; cur != nullptr;) {
            BtCursor* following = cur->next;
            kovsq_cursor_close(cur->cursor);
            cur->cursor = nullptr;
            cur->bt = nullptr;
            cur->table = nullptr;
            cur->prev = cur->next = nullptr;
            leaveEntry(cur);
            cur = following;
        }
        t->cursors = nullptr;
    }
    p->tables.clear();
    kovsq_tree_close(p->tree);
    // A statement left prepared (by a test's pragma) would keep the connection open.
    while (sqlite3_stmt* s = sqlite3_next_stmt(p->db, nullptr))
        sqlite3_finalize(s);
    int rc = sqlite3_close(p->db);
    delete p;
    return rc;
}

int sqlite3BtreeSetCacheSize(Btree* p, int pages) {
    if (p == nullptr)
        return SQLITE_MISUSE;
    if (pages < 10)
        pages = 10;
    std::string sql = "PRAGMA cache_size=" + std::to_string(pages);
    int rc = exec(p->db, sql.c_str());
    // A smaller cache can spill sooner: the file, and room in it, may be wanted now.
    if (rc == SQLITE_OK && p->transaction == Transaction::Write && p->writable && p->accepting)
        ensureSpace(p, 0, "changing the cache size");
    return rc;
}

int sqlite3BtreeSetPageSize(Btree* p, int pageSize, int reserve) {
    if (p == nullptr)
        return SQLITE_MISUSE;
    if (p->pageSizeFixed)
        return SQLITE_READONLY;
    if (!validPageSize(pageSize) || reserve > 255)
        return SQLITE_ERROR;
    std::string sql = "PRAGMA page_size=" + std::to_string(pageSize);
    int rc = exec(p->db, sql.c_str());
    if (rc == SQLITE_OK && reserve >= 0)
        rc = sqlite3_file_control(p->db, "main", SQLITE_FCNTL_RESERVE_BYTES, &reserve);
    return rc;
}

int sqlite3BtreeBeginTrans(Btree* p, int wrflag) {
    if (p == nullptr)
        return SQLITE_MISUSE;
    if (!p->writable || !p->accepting)
        return SQLITE_ERROR;
    if (p->transaction == Transaction::Write)
        return SQLITE_OK;
    if (wrflag == 0) {
        if (p->transaction == Transaction::Read)
            return SQLITE_OK;
        // BEGIN alone takes no lock; the read transaction of the B-tree layer
        // starts with the first read.
        int rc = exec(p->db, "BEGIN DEFERRED");
        if (rc == SQLITE_OK)
            p->transaction = Transaction::Read;
        return rc;
    }
    if (p->transaction == Transaction::Read) {
        // A read transaction has changed nothing; end it and start the write.
        int rc = exec(p->db, "COMMIT");
        if (rc != SQLITE_OK)
            return rc;
        p->transaction = Transaction::None;
    }
    int rc = exec(p->db, wrflag > 1 ? "BEGIN EXCLUSIVE" : "BEGIN IMMEDIATE");
    if (rc == SQLITE_OK) {
        p->transaction = Transaction::Write;
        p->pageSizeFixed = true;
    }
    return rc;
}

int sqlite3BtreeTxnState(Btree* p) {
    if (p == nullptr || p->transaction == Transaction::None)
        return SQLITE_TXN_NONE;
    return p->transaction == Transaction::Write && p->writable && p->accepting ? SQLITE_TXN_WRITE
                                                                              : SQLITE_TXN_READ;
}

int sqlite3BtreeIntegrityCheck(Btree* p, int maxErrors, int* pnErr, std::string* report) {
    if (p == nullptr || pnErr == nullptr || report == nullptr)
        return SQLITE_MISUSE;
    report->clear();
    *pnErr = 0;
    if (p->transaction != Transaction::Write)
        return SQLITE_OK;  // nothing was ever written
    // Everything gathered is merged first: the check reads every table.
    for (const auto& entry : p->tables)
        settle(p, entry.second.get());
    std::vector<std::uint32_t> roots = p->runTrees;
    for (const auto& entry : p->tables)
        roots.push_back(entry.first);
    char* text = nullptr;
    int n = kovsq_integrity_check(p->tree, roots.data(), static_cast<int>(roots.size()),
                                  maxErrors < 1 ? 1 : maxErrors, &text);
    if (n < 0)
        return SQLITE_NOMEM;
    *pnErr = n;
    if (text != nullptr)
        report->assign(text);
    kovsq_free(text);
    return SQLITE_OK;
}

namespace {

// SQLITE_OK when a table may be created or dropped now; else why not: SQLITE_LOCKED while a
// cursor is open (the change may move pages under it), SQLITE_ERROR outside a writable
// transaction.
int tableChangeRefused(Btree* p) {
    checkEngine(p);
    if (p->openCursors > 0)
        return SQLITE_LOCKED;
    if (p->transaction != Transaction::Write || !p->writable || !p->accepting)
        return SQLITE_ERROR;
    return SQLITE_OK;
}

}  // namespace

int sqlite3BtreeCreateTable(Btree* p, std::uint32_t* piTable, int flags) {
    if (p == nullptr || piTable == nullptr)
        return SQLITE_MISUSE;
    if (int refused = tableChangeRefused(p))
        return refused;

    auto t = std::make_unique<Table>();
    t->intKey = (flags & BTREE_INTKEY) != 0;
    t->hasData = (flags & BTREE_ZERODATA) == 0;
    std::uint32_t root = 0;
    clearTemporaryFileError();
    int rc = kovsq_create_table(p->tree, &root, t->intKey ? 1 : 0);
    if (rc != SQLITE_OK)
        return noteWriteFailure(p, rc, "creating a table");
    t->root = root;
    p->tables[root] = std::move(t);
    *piTable = root;
    return SQLITE_OK;
}

int sqlite3BtreeDropTable(Btree* p, std::uint32_t iTable, int* piMoved) {
    if (p == nullptr || piMoved == nullptr)
        return SQLITE_MISUSE;
    if (int refused = tableChangeRefused(p))
        return refused;
    auto found = p->tables.find(iTable);
    if (found == p->tables.end())
        return SQLITE_ERROR;
    // What the table gathered goes with it.
    if (std::unique_ptr<PendingLoad> load = takePending(p, found->second.get()))
        releaseRuns(p, *load, found->second->intKey);
    int rc = kovsq_drop_table(p->tree, iTable);
    if (rc != SQLITE_OK)
        return noteFailure(p, rc, "dropping a table");  // its root page still exists
    p->tables.erase(found);
    *piMoved = 0;
    return SQLITE_OK;
}

int sqlite3BtreeCursor(Btree* p, std::uint32_t iTable, int wrFlag, BtreeCompare xCmp, void* pArg,
                       BtCursor** ppCur) {
    (void)pArg;
    if (p == nullptr || ppCur == nullptr)
        return SQLITE_MISUSE;
    *ppCur = nullptr;
    if (xCmp != nullptr)
        return SQLITE_MISUSE;
    auto found = p->tables.find(iTable);
    if (found == p->tables.end())
        return SQLITE_ERROR;
    Table* t = found->second.get();
    if (wrFlag != 0 && t->readCursors > 0)
        return SQLITE_LOCKED;
    // A read cursor locks writers out: what the table gathered goes into it now.
    if (wrFlag == 0)
        settle(p, t);

    auto cur = std::make_unique<BtCursor>();
    // Tables exist only inside the write transaction; SQLite's writing
    // cursors need it to be still open (it always is: nothing ends it).
    int rc = kovsq_cursor_open(p->tree, iTable, t->intKey ? 1 : 0, wrFlag != 0 ? 1 : 0,
                               &cur->cursor);
    if (rc != SQLITE_OK)
        return noteFailure(p, rc, "opening a cursor");
    cur->bt = p;
    cur->table = t;
    cur->write = wrFlag != 0;
    link(cur.get());
    *ppCur = cur.release();
    checkEngine(p);
    return SQLITE_OK;
}

int sqlite3BtreeCloseCursor(BtCursor* pCur) {
    if (pCur == nullptr)
        return SQLITE_MISUSE;
    if (pCur->bt != nullptr) {
        Btree* bt = pCur->bt;
        unlink(pCur);
        kovsq_cursor_close(pCur->cursor);
        pCur->cursor = nullptr;
        checkEngine(bt);
    }
    delete pCur;
    return SQLITE_OK;
}

namespace {

// First and Last: flag 1 only for an empty table.
template <typename Move>
int moveToEnd(BtCursor* pCur, int* pRes, Move move) {
    if (pCur == nullptr || pRes == nullptr)
        return SQLITE_MISUSE;
    if (pCur->bt == nullptr) {
        *pRes = 1;
        return SQLITE_OK;
    }
    settle(pCur->bt, pCur->table);
    int empty = 1;
    int rc = afterMove(pCur, move(pCur->cursor, &empty));
    if (rc != SQLITE_OK)
        return rc;
    *pRes = pCur->onEntry ? 0 : 1;
    return SQLITE_OK;
}

// Next and Previous: flag 1 when there was no such entry, or the cursor was
// on none.
template <typename Step>
int step(BtCursor* pCur, int* pRes, Step stepOnce) {
    if (pCur == nullptr || pRes == nullptr)
        return SQLITE_MISUSE;
    if (!pCur->onEntry) {
        *pRes = 1;
        return SQLITE_OK;
    }
    int rc = afterMove(pCur, stepOnce(pCur->cursor));
    if (isFailure(rc))
        return rc;
    *pRes = pCur->onEntry ? 0 : 1;
    return SQLITE_OK;
}

}  // namespace

int sqlite3BtreeFirst(BtCursor* pCur, int* pRes) { return moveToEnd(pCur, pRes, kovsq_first); }

int sqlite3BtreeLast(BtCursor* pCur, int* pRes) { return moveToEnd(pCur, pRes, kovsq_last); }

int sqlite3BtreeNext(BtCursor* pCur, int* pRes) { return step(pCur, pRes, kovsq_next); }

int sqlite3BtreePrevious(BtCursor* pCur, int* pRes) { return step(pCur, pRes, kovsq_previous); }

int sqlite3BtreeEof(BtCursor* pCur) {
    if (pCur == nullptr)
        return SQLITE_MISUSE;  // nonzero: not on an entry
    return pCur->onEntry ? 0 : 1;
}

int sqlite3BtreeMoveto(BtCursor* pCur, const void* pKey, std::int64_t nKey, int* pRes) {
    if (pCur == nullptr || pRes == nullptr)
        return SQLITE_MISUSE;
    if (pCur->bt == nullptr) {
        *pRes = -1;
        return SQLITE_OK;
    }
    if (!pCur->table->intKey) {
        int refused = checkByteKey(pKey, nKey);
        if (refused != SQLITE_OK)
            return refused;
    }
    settle(pCur->bt, pCur->table);
    int cmp = 0;
    int rc = pCur->table->intKey
                 ? kovsq_seek_int(pCur->cursor, nKey, &cmp)
                 : kovsq_seek_key(pCur->cursor, pKey, static_cast<std::uint32_t>(nKey), &cmp);
    rc = afterMove(pCur, rc);
    if (rc != SQLITE_OK)
        return rc;
    if (!pCur->onEntry) {
        *pRes = -1;  // an empty table
        return SQLITE_OK;
    }
    // Where SQLite's search stopped is where an insert of the key goes (rememberSeek).
    int at = cmp == 0 ? KOVSQ_AT_ENTRY : KOVSQ_BEFORE_ENTRY;
    if (cmp < 0) {
        // SQLite stopped on the smaller neighbour: land on the larger one
        // when there is one, else come back to the last entry.
        int adjacent = 0;
        rc = afterMove(pCur, kovsq_next_adjacent(pCur->cursor, &adjacent));
        if (isFailure(rc))
            return rc;
        if (pCur->onEntry) {
            cmp = 1;
            at = adjacent ? KOVSQ_BEFORE_ENTRY : KOVSQ_SEARCH;
        } else {
            int empty = 1;
            rc = afterMove(pCur, kovsq_last(pCur->cursor, &empty));
            if (rc != SQLITE_OK)
                return rc;
            at = KOVSQ_AFTER_ENTRY;
        }
    }
    if (pCur->onEntry && at != KOVSQ_SEARCH)
        rememberSeek(pCur, pKey, nKey, at);
    *pRes = cmp;
    return SQLITE_OK;
}

namespace {

// KeySize and DataSize: 0 on no entry, else what `of` reads of the entry.
template <typename Size, typename Of>
int entrySize(BtCursor* pCur, Size* pSize, Of of) {
    if (pCur == nullptr || pSize == nullptr)
        return SQLITE_MISUSE;
    if (!pCur->onEntry) {
        *pSize = 0;
        return SQLITE_OK;
    }
    int rc = describe(pCur);
    if (rc != SQLITE_OK)
        return rc;
    *pSize = of(*pCur);
    return SQLITE_OK;
}

}  // namespace

int sqlite3BtreeKeySize(BtCursor* pCur, std::int64_t* pSize) {
    return entrySize(pCur, pSize, [](const BtCursor& c) {
        return c.table->intKey ? c.entry.intKey : static_cast<std::int64_t>(c.entry.keySize);
    });
}

int sqlite3BtreeKey(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf) {
    if (pCur == nullptr)
        return SQLITE_MISUSE;
    if (pCur->table != nullptr && pCur->table->intKey)
        return SQLITE_CORRUPT;
    std::uint64_t keyLen = 0;
    std::uint64_t dataLen = 0;
    entryLengths(pCur, &keyLen, &dataLen);
    if (std::uint64_t{offset} + amt > keyLen + dataLen)
        return SQLITE_ERROR;
    if (amt == 0)
        return SQLITE_OK;
    if (pBuf == nullptr)
        return SQLITE_MISUSE;
    return copyPayload(pCur, pCur->entry.keyOffset + offset, amt, pBuf);
}

namespace {

// Payload bytes [offset, offset+size) of the current entry in place, or, when they run onto
// overflow pages, a copy in `copy` (the cursor's, valid until it is used again). Null when the
// copy could not be read.
const void* payloadInPlace(BtCursor* cur, std::uint32_t offset, std::uint32_t size,
                           std::string& copy) {
    if (std::uint64_t{offset} + size <= cur->entry.localSize)
        return cur->entry.local + offset;
    copy.resize(size);
    if (copyPayload(cur, offset, size, copy.data()) != SQLITE_OK)
        return nullptr;
    return copy.data();
}

}  // namespace

const void* sqlite3BtreeKeyFetch(BtCursor* pCur, std::uint32_t* pAmt) {
    if (pCur == nullptr || pAmt == nullptr)
        return nullptr;
    *pAmt = 0;
    if (!pCur->onEntry || pCur->table->intKey || describe(pCur) != SQLITE_OK)
        return nullptr;
    const KovsqEntry& e = pCur->entry;
    const void* key = payloadInPlace(pCur, e.keyOffset, e.keySize, pCur->keyCopy);
    if (key != nullptr)
        *pAmt = e.keySize;
    return key;
}

const void* sqlite3BtreeDataFetch(BtCursor* pCur, std::uint32_t* pAmt) {
    if (pCur == nullptr || pAmt == nullptr)
        return nullptr;
    *pAmt = 0;
    if (!pCur->onEntry || describe(pCur) != SQLITE_OK)
        return nullptr;
    const KovsqEntry& e = pCur->entry;
    const void* data = payloadInPlace(pCur, e.keyOffset + e.keySize, e.dataSize, pCur->dataCopy);
    if (data != nullptr)
        *pAmt = e.dataSize;
    return data;
}

int sqlite3BtreeDataSize(BtCursor* pCur, std::uint32_t* pSize) {
    return entrySize(pCur, pSize, [](const BtCursor& c) { return c.entry.dataSize; });
}

int sqlite3BtreeData(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf) {
    if (pCur == nullptr)
        return SQLITE_MISUSE;
    std::uint64_t keyLen = 0;
    std::uint64_t dataLen = 0;
    entryLengths(pCur, &keyLen, &dataLen);
    if (std::uint64_t{offset} + amt > dataLen)
        return SQLITE_ERROR;
    if (amt == 0)
        return SQLITE_OK;
    if (pBuf == nullptr)
        return SQLITE_MISUSE;
    return copyPayload(pCur, pCur->entry.keyOffset + pCur->entry.keySize + offset, amt, pBuf);
}

int sqlite3BtreeInsert(BtCursor* pCur, const void* pKey, std::int64_t nKey, const void* pData,
                       int nData) {
    if (pCur == nullptr || pCur->bt == nullptr)
        return SQLITE_MISUSE;
    Btree* bt = pCur->bt;
    Table* t = pCur->table;
    if (bt->transaction != Transaction::Write || !bt->writable || !bt->accepting)
        return SQLITE_ERROR;
    if (!pCur->write)
        return SQLITE_PERM;
    if (t->readCursors > 0)
        return SQLITE_LOCKED;
    if (!t->intKey) {
        int refused = checkByteKey(pKey, nKey);
        if (refused != SQLITE_OK)
            return refused;
    }
    if (nData < 0)
        return SQLITE_ERROR;
    if (nData > kMaxLength)
        return SQLITE_TOOBIG;
    if (pData == nullptr && nData > 0)
        return SQLITE_MISUSE;
    const std::uint32_t dataSize = t->hasData ? static_cast<std::uint32_t>(nData) : 0;
    const std::uint32_t keySize = t->intKey ? 0 : static_cast<std::uint32_t>(nKey);
    // Room first: a refusal changes nothing. Enough for the entry gathered, written in a run and
    // merged by inserts, or put straight in (with splits up to a new root).
    const std::uint64_t bound = kovsq_entry_bound(bt->tree, t->intKey ? 1 : 0, keySize, dataSize);
    if (int rc = ensureSpace(bt, bound * (kRunQuarters + kInsertQuarters) / 4 + kSlackBytes,
                             kInserting))
        return rc;

    // Past the first few inserts since the table was read, inserts are gathered; an entry too
    // large to gather goes straight in.
    const bool gathering = t->insertsSinceRead >= bt->limits.directInserts &&
                           LoadBuffer::footprint(keySize, dataSize) <= bt->limits.bufferBytes / 4;
    if (t->insertsSinceRead < UINT32_MAX)
        ++t->insertsSinceRead;
    int at = gathering ? KOVSQ_SEARCH : rememberedPosition(pCur, pKey, nKey);

    // Every cursor on the table leaves its entry: their positions are
    // unspecified afterwards, and SQLite would otherwise save each one's key.
    // The inserting cursor keeps SQLite's position unless the insert is
    // gathered or a merge goes first, which write through cursors of their own.
    const bool ownPosition = !gathering && t->pending == nullptr;
    for (BtCursor* c = t->cursors; c != nullptr; c = c->next) {
        if (c != pCur || !ownPosition)
            kovsq_clear(c->cursor);
        leaveEntry(c);
        assert(c == pCur || !kovsq_valid(c->cursor));  // invariant 3
    }
    if (gathering)
        return gather(bt, t, pKey, nKey, pData, dataSize, bound);
    if (t->pending != nullptr) {
        // What was gathered goes in first, so that this newer entry wins over an equal key.
        int rc = mergePending(bt, t);
        if (rc != SQLITE_OK)
            return rc;
        at = KOVSQ_SEARCH;
    }
    bt->stats.insertsAfterSearch += at != KOVSQ_SEARCH ? 1 : 0;
    const LoadEntry entry{nKey, static_cast<const unsigned char*>(pKey), keySize,
                          static_cast<const unsigned char*>(pData), dataSize};
    const int rc = insertEntry(pCur->cursor, t->shape(), entry, at);
    if (isFailure(rc))
        kovsq_clear(pCur->cursor);  // SQLite may have left it faulted: on no entry, as the others
    return noteWriteFailure(bt, rc, kInserting);
}

}  // namespace kov::engine
