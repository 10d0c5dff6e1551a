// The B-tree operations over one private SQLite connection.
//
// How the operations map onto SQL:
//
//  * A table is an SQL table named "t<N>" (N counts up per engine, so a name
//    is never reused): integer keys are `(k INTEGER PRIMARY KEY, v BLOB)`, a
//    rowid table; byte-string keys with data are `(k BLOB PRIMARY KEY, v
//    BLOB) WITHOUT ROWID`; key-only entries are `(k BLOB PRIMARY KEY)
//    WITHOUT ROWID`. Keys are always bound as BLOBs (an empty key as a
//    zero-length blob, never NULL), so SQLite's own blob order (memcmp over
//    the shorter length, then the shorter first) is the key order. A table is
//    named by its root page in sqlite_master.
//
//  * A cursor is on an entry exactly when `row` points at one of its
//    statements that has just returned SQLITE_ROW; the entry's key and data
//    are that statement's columns, read in place. Four statements serve a
//    cursor: forward from a key (>=), forward after a key (>), backward
//    before a key (<) and backward from the end. Next and Previous step the
//    statement that is already running in their direction, so walking never
//    searches again; only a change of direction starts the other statement
//    at the current key. A cursor's statements come from its table's pool
//    and go back to it when the cursor closes, so opening and closing a
//    cursor (which the store does around every table creation) prepares
//    nothing.
//
//  * The engine's bookkeeping reproduces the refusals the store relies on,
//    before SQLite is asked anything: create and drop while cursors are open,
//    writers against read cursors, inserts through read cursors, reads past
//    the entry, a null key on a byte-string table.
//
// Invariants:
//  1. Every open cursor is on its table's list and counted in
//     Btree::openCursors; a read cursor is counted in Table::readCursors.
//  2. A cursor's `row` is null or one of the statements of its own set, and
//     that statement is the only one of the set not in its reset state.
//  3. No statement is running during CreateTable, DropTable, an insert into
//     the cursor's table, or Close (all cursors on the table are left first).
//  4. An inert cursor (engine closed) has bt == table == set == null and
//     row == null; it is freed only by sqlite3BtreeCloseCursor.
//  5. While `row` is set, the cursor's key and data fields describe its
//     current row; while it is null, the lengths are 0.

#include "engine/btree.h"

#include <sqlite3.h>

#include <climits>
#include <cstring>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace kov::engine {

namespace {

enum StatementKind : int {
    kForwardFrom = 0,     // WHERE k >= ?1 ORDER BY k
    kForwardAfter = 1,    // WHERE k > ?1 ORDER BY k
    kBackwardBefore = 2,  // WHERE k < ?1 ORDER BY k DESC
    kBackwardAll = 3,     // ORDER BY k DESC
    kStatementKinds = 4,
};

constexpr int kKeyColumn = 0;
constexpr int kDataColumn = 1;

enum class Transaction { None, Read, Write };

struct StatementSet {
    sqlite3_stmt* stmt[kStatementKinds] = {};

    StatementSet() = default;
    StatementSet(const StatementSet&) = delete;
    StatementSet& operator=(const StatementSet&) = delete;
    ~StatementSet() {
        for (sqlite3_stmt* s : stmt) sqlite3_finalize(s);
    }
};

}  // namespace

struct Table {
    std::uint32_t root = 0;
    bool intKey = false;
    bool hasData = true;
    std::string name;
    sqlite3_stmt* insert = nullptr;                   // prepared on first insert
    std::vector<std::unique_ptr<StatementSet>> spare;  // sets of closed cursors
    BtCursor* cursors = nullptr;                       // open cursors, a list
    int readCursors = 0;

    Table() = default;
    Table(const Table&) = delete;
    Table& operator=(const Table&) = delete;
    ~Table() { sqlite3_finalize(insert); }
};

struct Btree {
    sqlite3* db = nullptr;
    std::unordered_map<std::uint32_t, std::unique_ptr<Table>> tables;
    int openCursors = 0;
    Transaction transaction = Transaction::None;
    bool pageSizeFixed = false;
    std::uint64_t nextTableId = 1;
    sqlite3_stmt* rootOf = nullptr;  // SELECT rootpage ... WHERE name = ?1
};

struct BtCursor {
    Btree* bt = nullptr;
    Table* table = nullptr;
    bool write = false;
    std::unique_ptr<StatementSet> set;
    sqlite3_stmt* row = nullptr;
    int rowKind = -1;
    // The current entry, read once when the cursor steps onto it; the
    // pointers are SQLite's own and stay valid until `row` steps or resets.
    std::int64_t intKey = 0;
    const unsigned char* key = nullptr;
    std::uint64_t keyLen = 0;
    const unsigned char* data = nullptr;
    std::uint64_t dataLen = 0;
    BtCursor* prev = nullptr;  // neighbours on the table's list
    BtCursor* next = nullptr;
};

namespace {

int exec(sqlite3* db, const char* sql) { return sqlite3_exec(db, sql, nullptr, nullptr, nullptr); }

// After a failed statement SQLite may have rolled the transaction back on
// its own; keep the bookkeeping true to what the connection says.
void noteFailure(Btree* bt) {
    if (bt->db != nullptr && sqlite3_get_autocommit(bt->db) != 0) {
        bt->transaction = Transaction::None;
    }
}

std::string selectSql(const Table& t, int kind) {
    std::string sql = t.hasData ? "SELECT k, v FROM " : "SELECT k FROM ";
    sql += t.name;
    switch (kind) {
        case kForwardFrom:
            sql += " WHERE k >= ?1 ORDER BY k";
            break;
        case kForwardAfter:
            sql += " WHERE k > ?1 ORDER BY k";
            break;
        case kBackwardBefore:
            sql += " WHERE k < ?1 ORDER BY k DESC";
            break;
        default:
            sql += " ORDER BY k DESC";
            break;
    }
    return sql;
}

int prepare(sqlite3* db, const std::string& sql, sqlite3_stmt** out) {
    return sqlite3_prepare_v3(db, sql.c_str(), static_cast<int>(sql.size() + 1),
                              SQLITE_PREPARE_PERSISTENT, out, nullptr);
}

// The cursor's statement of the given kind, prepared on first use.
int statement(BtCursor* cur, int kind, sqlite3_stmt** out) {
    sqlite3_stmt*& s = cur->set->stmt[kind];
    if (s == nullptr) {
        int rc = prepare(cur->bt->db, selectSql(*cur->table, kind), &s);
        if (rc != SQLITE_OK) {
            s = nullptr;
            return rc;
        }
    }
    *out = s;
    return SQLITE_OK;
}

// Binds n bytes as a blob. A zero-length key is a zero-length blob, never
// NULL (SQLite binds NULL for a null pointer).
int bindBytes(sqlite3_stmt* s, int index, const void* p, std::uint64_t n) {
    if (n == 0) return sqlite3_bind_zeroblob(s, index, 0);
    return sqlite3_bind_blob64(s, index, p, n, SQLITE_STATIC);
}

int bindKey(const BtCursor* cur, sqlite3_stmt* s, const void* pKey, std::int64_t nKey) {
    if (cur->table->intKey) return sqlite3_bind_int64(s, 1, nKey);
    return bindBytes(s, 1, pKey, static_cast<std::uint64_t>(nKey));
}

// Binds the key of the entry the cursor stands on (copied: the statement
// that holds it is about to be reset).
int bindCurrentKey(const BtCursor* cur, sqlite3_stmt* s) {
    if (cur->table->intKey) return sqlite3_bind_int64(s, 1, cur->intKey);
    if (cur->keyLen == 0) return sqlite3_bind_zeroblob(s, 1, 0);
    return sqlite3_bind_blob64(s, 1, cur->key, cur->keyLen, SQLITE_TRANSIENT);
}

void clearEntry(BtCursor* cur) {
    cur->row = nullptr;
    cur->rowKind = -1;
    cur->intKey = 0;
    cur->key = cur->data = nullptr;
    cur->keyLen = cur->dataLen = 0;
}

// Takes the cursor off its entry: the running statement is reset.
void leave(BtCursor* cur) {
    if (cur->row != nullptr) {
        sqlite3_reset(cur->row);
        clearEntry(cur);
    }
}

// Reads the entry `s` has just stepped onto (blob pointer first, then its
// length, as SQLite asks).
void enter(BtCursor* cur, sqlite3_stmt* s, int kind) {
    cur->row = s;
    cur->rowKind = kind;
    if (cur->table->intKey) {
        cur->intKey = sqlite3_column_int64(s, kKeyColumn);
    } else {
        cur->key = static_cast<const unsigned char*>(sqlite3_column_blob(s, kKeyColumn));
        cur->keyLen = static_cast<std::uint64_t>(sqlite3_column_bytes(s, kKeyColumn));
    }
    if (cur->table->hasData) {
        cur->data = static_cast<const unsigned char*>(sqlite3_column_blob(s, kDataColumn));
        cur->dataLen = static_cast<std::uint64_t>(sqlite3_column_bytes(s, kDataColumn));
    }
}

// Steps `s`; on a row the cursor stands on it. Returns SQLITE_ROW,
// SQLITE_DONE (cursor on no entry) or an error (cursor on no entry).
int stepOnto(BtCursor* cur, sqlite3_stmt* s, int kind) {
    int rc = sqlite3_step(s);
    if (rc == SQLITE_ROW) {
        enter(cur, s, kind);
        return rc;
    }
    sqlite3_reset(s);
    clearEntry(cur);
    if (rc != SQLITE_DONE) noteFailure(cur->bt);
    return rc;
}

// Starts the statement of `kind` (bound by `bind`, or unbound) and steps
// onto its first row. The cursor's current statement is left first, after
// binding, so a bind may copy the current key.
template <typename Bind>
int start(BtCursor* cur, int kind, Bind bind) {
    sqlite3_stmt* s = nullptr;
    int rc = statement(cur, kind, &s);
    // A running statement cannot be bound again: leave it first. (A bind that
    // copies the current key always targets a statement of the other
    // direction, never the running one.)
    if (s != nullptr && s == cur->row) leave(cur);
    if (rc == SQLITE_OK) rc = bind(s);
    leave(cur);
    if (rc != SQLITE_OK) {
        if (s != nullptr) sqlite3_reset(s);
        return rc;
    }
    return stepOnto(cur, s, kind);
}

int noBind(sqlite3_stmt*) { return SQLITE_OK; }

bool isForward(int kind) { return kind == kForwardFrom || kind == kForwardAfter; }

// Result of a step that moved onto an entry or found none: SQLITE_OK with
// the flag, or the step's error with the flag unwritten.
int moveResult(int rc, int* pRes) {
    if (rc == SQLITE_ROW) {
        *pRes = 0;
        return SQLITE_OK;
    }
    if (rc == SQLITE_DONE) {
        *pRes = 1;
        return SQLITE_OK;
    }
    return rc;
}

void link(BtCursor* cur) {
    Table* t = cur->table;
    cur->prev = nullptr;
    cur->next = t->cursors;
    if (t->cursors != nullptr) t->cursors->prev = cur;
    t->cursors = cur;
    if (!cur->write) ++t->readCursors;
    ++cur->bt->openCursors;
}

void unlink(BtCursor* cur) {
    Table* t = cur->table;
    if (cur->prev != nullptr) {
        cur->prev->next = cur->next;
    } else {
        t->cursors = cur->next;
    }
    if (cur->next != nullptr) cur->next->prev = cur->prev;
    cur->prev = cur->next = nullptr;
    if (!cur->write) --t->readCursors;
    --cur->bt->openCursors;
}

// The cursor's key and data as one run of bytes: the span [offset,
// offset+amt), which the caller has checked lies within them, is copied
// from the key, then the data.
void copyPayload(const BtCursor* cur, std::uint64_t offset, std::uint64_t amt, unsigned char* out) {
    if (offset < cur->keyLen) {
        std::uint64_t n = cur->keyLen - offset < amt ? cur->keyLen - offset : amt;
        std::memcpy(out, cur->key + offset, n);
        out += n;
        amt -= n;
        offset = cur->keyLen;
    }
    if (amt > 0) std::memcpy(out, cur->data + (offset - cur->keyLen), amt);
}

bool validPageSize(int size) { return size >= 512 && size <= 32768 && (size & (size - 1)) == 0; }

}  // namespace

char*& temporaryDirectorySetting() { return sqlite3_temp_directory; }

sqlite3* TEST_connection(Btree* p) { return p == nullptr ? nullptr : p->db; }

int sqlite3BtreeOpen(const char* filename, sqlite3* db, Btree** ppBtree, int flags) {
    if (ppBtree == nullptr) return SQLITE_MISUSE;
    *ppBtree = nullptr;
    if (filename != nullptr || db != nullptr) return SQLITE_MISUSE;

    auto bt = std::make_unique<Btree>();
    // An empty name asks SQLite for a private temporary database on disk: the
    // file is made when the cache first spills, unlinked at once on POSIX, and
    // removed on close. One thread at a time uses it, so no mutex.
    int rc = sqlite3_open_v2("", &bt->db,
                             SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX |
                                 SQLITE_OPEN_PRIVATECACHE,
                             nullptr);
    if (rc == SQLITE_OK && (flags & BTREE_OMIT_JOURNAL) != 0) {
        rc = exec(bt->db, "PRAGMA journal_mode=OFF");
    }
    if (rc == SQLITE_OK && (flags & BTREE_NO_READLOCK) != 0) {
        rc = exec(bt->db, "PRAGMA locking_mode=EXCLUSIVE");
    }
    if (rc == SQLITE_OK) rc = exec(bt->db, "PRAGMA synchronous=OFF");
    if (rc == SQLITE_OK) {
        rc = prepare(bt->db, "SELECT rootpage FROM sqlite_master WHERE type='table' AND name=?1",
                     &bt->rootOf);
    }
    if (rc != SQLITE_OK) {
        sqlite3_finalize(bt->rootOf);
        sqlite3_close(bt->db);
        return rc;
    }
    *ppBtree = bt.release();
    return SQLITE_OK;
}

int sqlite3BtreeClose(Btree* p) {
    if (p == nullptr) return SQLITE_MISUSE;
    for (auto& entry : p->tables) {
        Table* t = entry.second.get();
        for (BtCursor* cur = t->cursors; cur != nullptr;) {
            BtCursor* following = cur->next;
            leave(cur);
            cur->set.reset();
            cur->bt = nullptr;
            cur->table = nullptr;
            cur->prev = cur->next = nullptr;
            cur = following;
        }
        t->cursors = nullptr;
    }
    p->tables.clear();  // finalizes every table's statements
    sqlite3_finalize(p->rootOf);
    // Anything still prepared on the connection would keep it open.
    while (sqlite3_stmt* s = sqlite3_next_stmt(p->db, nullptr)) sqlite3_finalize(s);
    int rc = sqlite3_close(p->db);
    delete p;
    return rc;
}

int sqlite3BtreeSetCacheSize(Btree* p, int pages) {
    if (p == nullptr) return SQLITE_MISUSE;
    if (pages < 10) pages = 10;
    std::string sql = "PRAGMA cache_size=" + std::to_string(pages);
    return exec(p->db, sql.c_str());
}

int sqlite3BtreeSetPageSize(Btree* p, int pageSize, int reserve) {
    if (p == nullptr) return SQLITE_MISUSE;
    if (p->pageSizeFixed) return SQLITE_READONLY;
    if (!validPageSize(pageSize) || reserve > 255) return SQLITE_ERROR;
    std::string sql = "PRAGMA page_size=" + std::to_string(pageSize);
    int rc = exec(p->db, sql.c_str());
    if (rc == SQLITE_OK && reserve >= 0) {
        rc = sqlite3_file_control(p->db, "main", SQLITE_FCNTL_RESERVE_BYTES, &reserve);
    }
    return rc;
}

int sqlite3BtreeBeginTrans(Btree* p, int wrflag) {
    if (p == nullptr) return SQLITE_MISUSE;
    if (p->transaction == Transaction::Write) return SQLITE_OK;
    if (wrflag == 0) {
        if (p->transaction == Transaction::Read) return SQLITE_OK;
        int rc = exec(p->db, "BEGIN DEFERRED");
        if (rc == SQLITE_OK) p->transaction = Transaction::Read;
        return rc;
    }
    if (p->transaction == Transaction::Read) {
        // A read transaction has changed nothing; end it and start the write.
        int rc = exec(p->db, "COMMIT");
        if (rc != SQLITE_OK) return rc;
        p->transaction = Transaction::None;
    }
    int rc = exec(p->db, wrflag > 1 ? "BEGIN EXCLUSIVE" : "BEGIN IMMEDIATE");
    if (rc == SQLITE_OK) {
        p->transaction = Transaction::Write;
        p->pageSizeFixed = true;
    }
    return rc;
}

int sqlite3BtreeCreateTable(Btree* p, std::uint32_t* piTable, int flags) {
    if (p == nullptr || piTable == nullptr) return SQLITE_MISUSE;
    if (p->openCursors > 0) return SQLITE_LOCKED;
    if (p->transaction != Transaction::Write) return SQLITE_ERROR;

    auto t = std::make_unique<Table>();
    t->intKey = (flags & BTREE_INTKEY) != 0;
    t->hasData = (flags & BTREE_ZERODATA) == 0;
    t->name = "t" + std::to_string(p->nextTableId);
    std::string sql = "CREATE TABLE " + t->name;
    if (t->intKey) {
        sql += t->hasData ? " (k INTEGER PRIMARY KEY, v BLOB)" : " (k INTEGER PRIMARY KEY)";
    } else {
        sql += t->hasData ? " (k BLOB PRIMARY KEY, v BLOB) WITHOUT ROWID"
                          : " (k BLOB PRIMARY KEY) WITHOUT ROWID";
    }
    int rc = exec(p->db, sql.c_str());
    if (rc != SQLITE_OK) {
        noteFailure(p);
        return rc;
    }
    ++p->nextTableId;
    p->pageSizeFixed = true;

    sqlite3_bind_text(p->rootOf, 1, t->name.c_str(), static_cast<int>(t->name.size()),
                      SQLITE_STATIC);
    rc = sqlite3_step(p->rootOf);
    std::int64_t root = rc == SQLITE_ROW ? sqlite3_column_int64(p->rootOf, 0) : 0;
    sqlite3_reset(p->rootOf);
    if (rc != SQLITE_ROW || root <= 0 || root > UINT32_MAX) {
        return rc == SQLITE_ROW || rc == SQLITE_DONE ? SQLITE_CORRUPT : rc;
    }
    t->root = static_cast<std::uint32_t>(root);
    p->tables[t->root] = std::move(t);
    *piTable = static_cast<std::uint32_t>(root);
    return SQLITE_OK;
}

int sqlite3BtreeDropTable(Btree* p, std::uint32_t iTable, int* piMoved) {
    if (p == nullptr || piMoved == nullptr) return SQLITE_MISUSE;
    if (p->openCursors > 0) return SQLITE_LOCKED;
    if (p->transaction != Transaction::Write) return SQLITE_ERROR;
    auto found = p->tables.find(iTable);
    if (found == p->tables.end()) return SQLITE_ERROR;

    Table* t = found->second.get();
    // The table's statements would hold its schema entry; finalize them first.
    sqlite3_finalize(t->insert);
    t->insert = nullptr;
    t->spare.clear();
    std::string sql = "DROP TABLE " + t->name;
    int rc = exec(p->db, sql.c_str());
    if (rc != SQLITE_OK) {
        noteFailure(p);
        return rc;
    }
    p->tables.erase(found);
    *piMoved = 0;
    return SQLITE_OK;
}

int sqlite3BtreeCursor(Btree* p, std::uint32_t iTable, int wrFlag, BtreeCompare xCmp, void* pArg,
                       BtCursor** ppCur) {
    (void)pArg;
    if (p == nullptr || ppCur == nullptr) return SQLITE_MISUSE;
    *ppCur = nullptr;
    if (xCmp != nullptr) return SQLITE_MISUSE;
    auto found = p->tables.find(iTable);
    if (found == p->tables.end()) return SQLITE_ERROR;
    Table* t = found->second.get();
    if (wrFlag != 0 && t->readCursors > 0) return SQLITE_LOCKED;

    auto cur = std::make_unique<BtCursor>();
    cur->bt = p;
    cur->table = t;
    cur->write = wrFlag != 0;
    if (!t->spare.empty()) {
        cur->set = std::move(t->spare.back());
        t->spare.pop_back();
    } else {
        cur->set = std::make_unique<StatementSet>();
    }
    link(cur.get());
    *ppCur = cur.release();
    return SQLITE_OK;
}

int sqlite3BtreeCloseCursor(BtCursor* pCur) {
    if (pCur == nullptr) return SQLITE_MISUSE;
    if (pCur->bt != nullptr) {
        leave(pCur);
        unlink(pCur);
        pCur->table->spare.push_back(std::move(pCur->set));
    }
    delete pCur;
    return SQLITE_OK;
}

int sqlite3BtreeFirst(BtCursor* pCur, int* pRes) {
    if (pCur == nullptr || pRes == nullptr) return SQLITE_MISUSE;
    if (pCur->bt == nullptr) return moveResult(SQLITE_DONE, pRes);
    int rc = start(pCur, kForwardFrom, [pCur](sqlite3_stmt* s) {
        return pCur->table->intKey ? sqlite3_bind_int64(s, 1, INT64_MIN)
                                   : sqlite3_bind_zeroblob(s, 1, 0);
    });
    return moveResult(rc, pRes);
}

int sqlite3BtreeLast(BtCursor* pCur, int* pRes) {
    if (pCur == nullptr || pRes == nullptr) return SQLITE_MISUSE;
    if (pCur->bt == nullptr) return moveResult(SQLITE_DONE, pRes);
    return moveResult(start(pCur, kBackwardAll, noBind), pRes);
}

int sqlite3BtreeNext(BtCursor* pCur, int* pRes) {
    if (pCur == nullptr || pRes == nullptr) return SQLITE_MISUSE;
    if (pCur->row == nullptr) return moveResult(SQLITE_DONE, pRes);
    if (isForward(pCur->rowKind)) return moveResult(stepOnto(pCur, pCur->row, pCur->rowKind), pRes);
    int rc = start(pCur, kForwardAfter, [pCur](sqlite3_stmt* s) { return bindCurrentKey(pCur, s); });
    return moveResult(rc, pRes);
}

int sqlite3BtreePrevious(BtCursor* pCur, int* pRes) {
    if (pCur == nullptr || pRes == nullptr) return SQLITE_MISUSE;
    if (pCur->row == nullptr) return moveResult(SQLITE_DONE, pRes);
    if (!isForward(pCur->rowKind)) return moveResult(stepOnto(pCur, pCur->row, pCur->rowKind), pRes);
    int rc =
        start(pCur, kBackwardBefore, [pCur](sqlite3_stmt* s) { return bindCurrentKey(pCur, s); });
    return moveResult(rc, pRes);
}

int sqlite3BtreeEof(BtCursor* pCur) {
    if (pCur == nullptr) return SQLITE_MISUSE;  // nonzero: not on an entry
    return pCur->row == nullptr ? 1 : 0;
}

int sqlite3BtreeMoveto(BtCursor* pCur, const void* pKey, std::int64_t nKey, int* pRes) {
    if (pCur == nullptr || pRes == nullptr) return SQLITE_MISUSE;
    if (pCur->bt == nullptr) {
        *pRes = -1;
        return SQLITE_OK;
    }
    if (!pCur->table->intKey) {
        if (pKey == nullptr) return SQLITE_CORRUPT;
        if (nKey < 0) return SQLITE_ERROR;
    }
    // Land on the smallest entry not below the key; when there is none, on
    // the largest entry below it.
    int rc = start(pCur, kForwardFrom,
                   [pCur, pKey, nKey](sqlite3_stmt* s) { return bindKey(pCur, s, pKey, nKey); });
    if (rc == SQLITE_ROW) {
        bool equal;
        if (pCur->table->intKey) {
            equal = pCur->intKey == nKey;
        } else {
            equal = pCur->keyLen == static_cast<std::uint64_t>(nKey) &&
                    (nKey == 0 || std::memcmp(pCur->key, pKey, pCur->keyLen) == 0);
        }
        *pRes = equal ? 0 : 1;
        return SQLITE_OK;
    }
    if (rc != SQLITE_DONE) return rc;
    rc = start(pCur, kBackwardBefore,
               [pCur, pKey, nKey](sqlite3_stmt* s) { return bindKey(pCur, s, pKey, nKey); });
    if (rc != SQLITE_ROW && rc != SQLITE_DONE) return rc;
    *pRes = -1;
    return SQLITE_OK;
}

int sqlite3BtreeKeySize(BtCursor* pCur, std::int64_t* pSize) {
    if (pCur == nullptr || pSize == nullptr) return SQLITE_MISUSE;
    // Both fields read 0 on no entry.
    *pSize = pCur->table != nullptr && pCur->table->intKey ? pCur->intKey
                                                            : static_cast<std::int64_t>(pCur->keyLen);
    return SQLITE_OK;
}

int sqlite3BtreeKey(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf) {
    if (pCur == nullptr) return SQLITE_MISUSE;
    if (pCur->table != nullptr && pCur->table->intKey) return SQLITE_CORRUPT;
    if (std::uint64_t{offset} + amt > pCur->keyLen + pCur->dataLen) return SQLITE_ERROR;
    if (amt == 0) return SQLITE_OK;
    if (pBuf == nullptr) return SQLITE_MISUSE;
    copyPayload(pCur, offset, amt, static_cast<unsigned char*>(pBuf));
    return SQLITE_OK;
}

const void* sqlite3BtreeKeyFetch(BtCursor* pCur, std::uint32_t* pAmt) {
    if (pCur == nullptr || pAmt == nullptr) return nullptr;
    if (pCur->row == nullptr || pCur->table->intKey || pCur->keyLen > UINT32_MAX) {
        *pAmt = 0;
        return nullptr;
    }
    *pAmt = static_cast<std::uint32_t>(pCur->keyLen);
    // SQLite hands out no pointer for an empty blob; the key is then empty.
    static const unsigned char kEmpty = 0;
    return pCur->key != nullptr ? pCur->key : &kEmpty;
}

int sqlite3BtreeDataSize(BtCursor* pCur, std::uint32_t* pSize) {
    if (pCur == nullptr || pSize == nullptr) return SQLITE_MISUSE;
    *pSize = static_cast<std::uint32_t>(pCur->dataLen);
    return SQLITE_OK;
}

int sqlite3BtreeData(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf) {
    if (pCur == nullptr) return SQLITE_MISUSE;
    if (std::uint64_t{offset} + amt > pCur->dataLen) return SQLITE_ERROR;
    if (amt == 0) return SQLITE_OK;
    if (pBuf == nullptr) return SQLITE_MISUSE;
    std::memcpy(pBuf, pCur->data + offset, amt);
    return SQLITE_OK;
}

int sqlite3BtreeInsert(BtCursor* pCur, const void* pKey, std::int64_t nKey, const void* pData,
                       int nData) {
    if (pCur == nullptr || pCur->bt == nullptr) return SQLITE_MISUSE;
    Btree* bt = pCur->bt;
    Table* t = pCur->table;
    if (bt->transaction != Transaction::Write) return SQLITE_ERROR;
    if (!pCur->write) return SQLITE_PERM;
    if (t->readCursors > 0) return SQLITE_LOCKED;
    if (!t->intKey) {
        if (pKey == nullptr) return SQLITE_CORRUPT;
        if (nKey < 0) return SQLITE_ERROR;
    }
    if (nData < 0) return SQLITE_ERROR;
    if (pData == nullptr && nData > 0) return SQLITE_MISUSE;

    if (t->insert == nullptr) {
        std::string sql;
        if (t->hasData) {
            sql = "INSERT OR REPLACE INTO " + t->name + " (k, v) VALUES (?1, ?2)";
        } else {
            // An equal key is the same entry: nothing to replace.
            sql = "INSERT OR IGNORE INTO " + t->name + " (k) VALUES (?1)";
        }
        int rc = prepare(bt->db, sql, &t->insert);
        if (rc != SQLITE_OK) {
            t->insert = nullptr;
            return rc;
        }
    }
    sqlite3_stmt* s = t->insert;
    int rc = bindKey(pCur, s, pKey, nKey);
    if (rc == SQLITE_OK && t->hasData) rc = bindBytes(s, 2, pData, static_cast<std::uint64_t>(nData));
    if (rc != SQLITE_OK) return rc;

    // Every cursor on the table leaves its entry: none may be reading the
    // table while it changes, and their positions are unspecified afterwards.
    for (BtCursor* c = t->cursors; c != nullptr; c = c->next) leave(c);

    rc = sqlite3_step(s);
    sqlite3_reset(s);
    if (rc == SQLITE_DONE) return SQLITE_OK;
    noteFailure(bt);
    return rc;
}

}  // namespace kov::engine
