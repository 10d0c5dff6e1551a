// The storage engine binding: the ordered B-tree operations the store is
// built on, implemented on SQLite's B-tree layer: one connection of the
// library's private SQLite holds one temporary database, whose tables are
// SQLite B-trees (engine/sqlite_btree.h says how entries are laid out).
//
// What this layer promises (each rule has its own test in
// tests/engine/engine_test.cpp):
//
//  1. Key order. Byte-string keys compare bytewise unsigned over the shorter
//     length, then the shorter key first. Integer keys compare as signed
//     64-bit numbers.
//  2. sqlite3BtreeMoveto leaves the cursor next to the sought key and says
//     where: 0 = on an entry equal to the key; negative = on the largest
//     entry smaller than the key (or on no entry when the table is empty);
//     positive = on the smallest entry larger than the key. This binding
//     lands on the larger neighbour whenever one exists. A null key pointer
//     on a byte-string table is refused with SQLITE_CORRUPT.
//  3. First/Last set their flag to 1 only for an empty table. Next/Previous
//     set it to 1 when there was no following/preceding entry, or when the
//     cursor was on no entry; the cursor is then on no entry. A flag is not
//     written when the call fails.
//  4. sqlite3BtreeEof is nonzero in every state other than "on an entry".
//  5. sqlite3BtreeKey on an integer-keyed table is refused with
//     SQLITE_CORRUPT. A Key or Data read whose offset plus amount goes past
//     the entry (key plus data for Key, data for Data) is refused with
//     SQLITE_ERROR. Refused reads write nothing. A Key read longer than the
//     key continues into the data bytes.
//  6. sqlite3BtreeInsert replaces an entry with an equal key, key and data
//     together, or adds a new one. Afterwards every cursor on that table,
//     the inserting one included, is on no entry until it is moved again.
//  7. An insert through a cursor opened without the write flag is refused
//     with SQLITE_PERM.
//  8. While any read cursor (write flag 0) is open on a table, opening a
//     writing cursor on it is refused with SQLITE_LOCKED (the out-pointer
//     receives null), and so is an insert into it. Opening a cursor never
//     moves another one.
//  9. CreateTable and DropTable are refused with SQLITE_LOCKED while any
//     cursor is open on the handle, and with SQLITE_ERROR when no write
//     transaction is active. Inserts need the write transaction as well
//     (SQLITE_ERROR otherwise); reads do not.
// 10. SetPageSize accepts a power of two from 512 to 32768, and only before
//     the database's first page is fixed (a write transaction or a table
//     fixes it): afterwards SQLITE_READONLY.
// 11. KeySize and DataSize report 0 for a cursor on no entry.
//
// Handles. Every operation tolerates a null engine or cursor handle: it
// returns SQLITE_MISUSE and writes no out-value (for sqlite3BtreeEof that
// nonzero answer also means "not on an entry"). Closing the engine closes
// its SQLite cursors and leaves each of its cursor handles as an inert object that answers like a cursor on an empty
// table (moves report no entry, sizes are 0, reads past nothing are
// refused, inserts are refused with SQLITE_MISUSE) until it is itself
// closed with sqlite3BtreeCloseCursor, which frees it. So a cursor handle
// stays safe to use for as long as it has not been closed, whatever
// happened to its engine.
//
// Threads: an engine handle and its cursors are used from one thread at a
// time; nothing here takes a lock.
//
// Room in the temporary file. The file is made only in the directory of
// temporaryDirectorySetting() (engine/temp_file.h), and room in it is
// reserved ahead of the pages the database holds and of what gathered loads
// may still take, so that writing out a page never meets a full disk. An
// insert (or a table creation) for which no room can be reserved, or that
// needs the file when it cannot be made, is refused with SQLITE_FULL (or
// another I/O code the system gave) or SQLITE_CANTOPEN and changes nothing.
// That refusal is kept as the engine's failure (sqlite3BtreeFailure,
// sqlite3BtreeFailureDetail) and every later insert, table creation and drop
// is refused with SQLITE_ERROR until the engine is closed; everything
// inserted before reads back, gathered loads included (they are merged at the
// next read of their table, in the room held for them).
//
// Refusals leave every state as it was. Failures reported by SQLite itself
// (I/O errors, a full disk, out of memory) are returned as its result code;
// a cursor whose step failed is left on no entry. After any such failure
// the write transaction counts as ended (sqlite3BtreeTxnState): every later
// insert, table creation and drop, and BeginTrans, is refused with
// SQLITE_ERROR until the engine is closed. There is no journal, so nothing
// can undo an insert that failed half-way, and writes on top of what it left
// could silently damage entries that still read back whole.
// docs/faults.md says what stays readable after each kind of fault.
#ifndef KOVPAGER_ENGINE_BTREE_H
#define KOVPAGER_ENGINE_BTREE_H

// Include this header before <sqlite3.h> where both are needed: the result
// codes below share SQLite's macro names and values.
#include <cstddef>
#include <cstdint>
#include <string>

struct sqlite3;

namespace kov::engine {

struct Btree;     // one private connection holding one temporary database
struct BtCursor;  // a position in one table

// Result codes, with SQLite's values (btree.cpp checks them against SQLite's header).
enum : int {
    SQLITE_OK = 0,
    SQLITE_ERROR = 1,
    SQLITE_PERM = 3,
    SQLITE_LOCKED = 6,
    SQLITE_NOMEM = 7,
    SQLITE_READONLY = 8,
    SQLITE_IOERR = 10,
    SQLITE_CORRUPT = 11,
    SQLITE_FULL = 13,
    SQLITE_TOOBIG = 18,
    SQLITE_MISUSE = 21,
};

// Table flags for sqlite3BtreeCreateTable. The store uses 0 (byte-string
// key with data), BTREE_INTKEY | BTREE_LEAFDATA (integer key with data) and
// BTREE_ZERODATA (byte-string key only).
enum : int {
    BTREE_INTKEY = 1,
    BTREE_ZERODATA = 2,
    BTREE_LEAFDATA = 4,
};

// Transaction states of sqlite3BtreeTxnState.
enum : int {
    SQLITE_TXN_NONE = 0,
    SQLITE_TXN_READ = 1,
    SQLITE_TXN_WRITE = 2,
};

// Open flags for sqlite3BtreeOpen.
enum : int {
    BTREE_OMIT_JOURNAL = 1,
    BTREE_NO_READLOCK = 2,
};

// Comparison callback type of sqlite3BtreeCursor. Only null (the default
// byte order) is supported; any other value is refused with SQLITE_MISUSE.
using BtreeCompare = int (*)(void*, int, const void*, int, const void*);

// The engine's temporary-directory setting (SQLite's global of that name).
// Whoever opens the engine points it at a buffer that outlives the engine;
// this binding only reads it, through SQLite.
char*& temporaryDirectorySetting();

// Opens a private temporary database on disk (no file name: the file is
// made in the temporary directory, and only there, once the database could
// outgrow half its cache, and is deleted on close; see "Room in the
// temporary file" below). `filename` must be null and `db` must be null.
// flags: BTREE_OMIT_JOURNAL = no rollback journal; BTREE_NO_READLOCK = no
// read locks (the file is held exclusively). Writes the handle to
// *ppBtree, or null on failure.
int sqlite3BtreeOpen(const char* filename, sqlite3* db, Btree** ppBtree, int flags);

// Closes the engine: the transaction is discarded, the temporary file is deleted, and every cursor still open
// becomes inert (see above). The handle is freed.
int sqlite3BtreeClose(Btree* p);

// Page-cache size in pages (values below 10 count as 10).
int sqlite3BtreeSetCacheSize(Btree* p, int pages);

// Page size and reserved bytes per page (-1 keeps the current reserve,
// otherwise 0 to 255). An invalid page size is refused with SQLITE_ERROR.
int sqlite3BtreeSetPageSize(Btree* p, int pageSize, int reserve);

// Begins a transaction: write flag 0 = read, 1 = write, above 1 = write
// with the exclusive lock taken at once. Never committed by the store.
// Refused with SQLITE_ERROR once a failure has ended the write transaction.
int sqlite3BtreeBeginTrans(Btree* p, int wrflag);

// The first failure SQLite reported since the engine opened (the one that
// ended its write transaction): SQLite's extended result code (for example
// SQLITE_IOERR_WRITE, 778), or SQLITE_OK when there was none. *operation,
// when not null, receives what the engine was doing then, as a phrase
// ("inserting an entry", "moving a cursor", "reading an entry", "creating a
// table", "dropping a table", "opening a cursor", "changing the cache size";
// "" when there was none). SQLITE_MISUSE for a null handle, *operation
// unwritten.
int sqlite3BtreeFailure(Btree* p, const char** operation);

// For a first failure that was a refusal for room or for the temporary file
// (see "Room in the temporary file" below): the system's words, naming the
// directory (for example "cannot make a file in /ro: Read-only file system").
// Empty otherwise, and for a null handle.
std::string sqlite3BtreeFailureDetail(Btree* p);

// True when the first failure was such a refusal: it changed nothing, and
// what tables had gathered is still merged at their next read. False
// otherwise, and for a null handle.
bool sqlite3BtreeFailureWasRefusal(Btree* p);

// True while `p` is an engine opened by sqlite3BtreeOpen and not yet closed.
// A handle kept elsewhere (a copy of the pager's) can outlive its engine;
// this tells, without touching the handle.
bool sqlite3BtreeIsOpen(Btree* p);

// SQLite's English text for a result code, primary or extended.
const char* resultText(int code);

// SQLITE_TXN_WRITE while writes are accepted, SQLITE_TXN_READ for a read
// transaction and for a write transaction that a failure ended (reads go
// on, writes are refused), SQLITE_TXN_NONE before any transaction. A null
// handle answers SQLITE_TXN_NONE.
int sqlite3BtreeTxnState(Btree* p);

// SQLite's own integrity check of the whole database file: every table of
// the engine (dropped ones excepted), the free-page list, and that every
// page belongs to one of them. Writes the number of problems found to *pnErr
// and, when there are any, SQLite's description of at most maxErrors of them
// to *report (cleared otherwise). SQLITE_NOMEM when the check could not run.
int sqlite3BtreeIntegrityCheck(Btree* p, int maxErrors, int* pnErr, std::string* report);

// Creates an empty table with the given flags and writes its root page.
int sqlite3BtreeCreateTable(Btree* p, std::uint32_t* piTable, int flags);

// Drops the table whose root page is given; *piMoved receives 0 (no page is
// ever relocated). Dropping a page that names no table is SQLITE_ERROR.
int sqlite3BtreeDropTable(Btree* p, std::uint32_t iTable, int* piMoved);

// Opens a cursor on the table with the given root page (refused with
// SQLITE_ERROR when no table has that root). wrFlag 1 = a writing cursor.
// *ppCur receives the handle, or null when refused (a null engine handle
// writes nothing, as everywhere).
int sqlite3BtreeCursor(Btree* p, std::uint32_t iTable, int wrFlag, BtreeCompare xCmp,
                       void* pArg, BtCursor** ppCur);

// Closes and frees a cursor (inert ones included).
int sqlite3BtreeCloseCursor(BtCursor* pCur);

int sqlite3BtreeFirst(BtCursor* pCur, int* pRes);
int sqlite3BtreeLast(BtCursor* pCur, int* pRes);
int sqlite3BtreeNext(BtCursor* pCur, int* pRes);
int sqlite3BtreePrevious(BtCursor* pCur, int* pRes);
int sqlite3BtreeEof(BtCursor* pCur);

// pKey/nKey: the key bytes and their length on byte-string tables; on
// integer-keyed tables pKey is ignored (the store passes null) and nKey is
// the integer key itself. A refused move (null key on a byte-string table:
// SQLITE_CORRUPT; negative length: SQLITE_ERROR) writes no *pRes and leaves
// the cursor where it was; a move that fails inside SQLite leaves it on no
// entry.
int sqlite3BtreeMoveto(BtCursor* pCur, const void* pKey, std::int64_t nKey, int* pRes);

// The key's length in bytes, or the integer key itself on an
// integer-keyed table; 0 on no entry.
int sqlite3BtreeKeySize(BtCursor* pCur, std::int64_t* pSize);

// Copies amt bytes of key-then-data, from offset, into pBuf.
int sqlite3BtreeKey(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf);

// The current entry's key bytes in place, without a copy: a pointer valid
// until the cursor moves or its table changes, with *pAmt set to the key's
// length. Null (and *pAmt 0) on no entry and on an integer-keyed table;
// null with *pAmt untouched for a null handle.
const void* sqlite3BtreeKeyFetch(BtCursor* pCur, std::uint32_t* pAmt);

// The current entry's data bytes in place, as sqlite3BtreeKeyFetch hands out
// its key (a copy held by the cursor when the data runs onto overflow pages):
// valid until the cursor moves or its table changes. Null (and *pAmt 0) on no
// entry; a non-null pointer with *pAmt 0 for empty data.
const void* sqlite3BtreeDataFetch(BtCursor* pCur, std::uint32_t* pAmt);

// The data's length in bytes; 0 on no entry.
int sqlite3BtreeDataSize(BtCursor* pCur, std::uint32_t* pSize);

// Copies amt bytes of the data, from offset, into pBuf.
int sqlite3BtreeData(BtCursor* pCur, std::uint32_t offset, std::uint32_t amt, void* pBuf);

// Inserts or replaces one entry. pKey/nKey as for Moveto (a null key on a
// byte-string table is refused with SQLITE_CORRUPT, a negative key length
// with SQLITE_ERROR). pData may be null only when nData is 0 (otherwise
// SQLITE_MISUSE); a negative nData is refused with SQLITE_ERROR; keys or
// data above SQLite's length limit (1e9 bytes) with SQLITE_TOOBIG. On a
// key-only table the data is not stored. Refused inserts change nothing.
int sqlite3BtreeInsert(BtCursor* pCur, const void* pKey, std::int64_t nKey, const void* pData,
                       int nData);

// Loads. Inserts into a table that nothing reads are not put into its B-tree one by one: they are
// gathered in memory, written out in sorted runs when the memory set aside for that is full, and
// merged into the B-tree in key order before the table is next read (engine/sorted_load.h). A
// read is First, Last or Moveto on any cursor of the table, and opening a read cursor on it; every
// other operation of a cursor on a table with gathered inserts finds it on no entry (rule 6).
// IntegrityCheck merges every table first. The first `directInserts` inserts after a read go
// straight into the B-tree, so a table read between its inserts is never gathered. None of this
// changes what any operation returns; a failure while writing a run or merging is kept as a
// failure of an insert ("inserting an entry"), and what was gathered and not yet merged is then
// lost. DropTable and closing the engine discard what is gathered.
struct LoadLimits {
    std::size_t bufferBytes;      // memory for the buffers of all tables together
    std::uint32_t directInserts;  // inserts after a read of the table that are not gathered
};
inline constexpr LoadLimits kDefaultLoadLimits{std::size_t{8} << 20, 16};

// Test seam: the limits of every engine opened from now on (a tiny buffer reaches runs and merges
// in a few entries); returns the previous ones.
LoadLimits TEST_setLoadLimits(LoadLimits limits);

// Test seam: what the engine's loads have done since it opened, so that tests can tell which
// paths they reached.
struct LoadStats {
    std::uint64_t gathered = 0;         // inserts gathered in a load buffer
    std::uint64_t runsWritten = 0;      // buffers written out as runs
    std::uint64_t merges = 0;           // loads merged into their table
    std::uint64_t mergedByAppend = 0;   // of those, merged by appending
    std::uint64_t insertsAfterSearch = 0;  // inserts placed where the cursor's search stopped
};
LoadStats TEST_loadStats(Btree* p);

// Test seam: the SQLite connection behind an engine handle (null for a
// null handle), so tests can look at its settings and its file.
sqlite3* TEST_connection(Btree* p);

// Test seam: the value of a setting of the engine's connection (`pragma` is "PRAGMA cache_size",
// ...); -1 when it cannot be read.
std::int64_t TEST_pragmaValue(Btree* p, const char* pragma);

// Test seam: how many engines sqlite3BtreeOpen has opened in this process.
std::uint64_t TEST_enginesOpened();

}  // namespace kov::engine

#endif  // KOVPAGER_ENGINE_BTREE_H
