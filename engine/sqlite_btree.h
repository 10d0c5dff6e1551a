/* The narrow interface between the engine binding (btree.cpp) and SQLite's
 * internal B-tree layer (sqlite_btree.c, the one unit compiled together with
 * the library's private SQLite).
 *
 * Nothing here knows the store's rules: no refusals, no bookkeeping of open
 * cursors, no handling of null handles. Those are btree.cpp's. What this
 * interface does know is how an entry is laid out:
 *
 *   - an integer-keyed table is an intkey B-tree: the key is the entry's
 *     integer key, the payload is the data;
 *   - a byte-string table and a key-only table are index B-trees whose
 *     entries are SQLite records: the key as a BLOB, then (byte-string
 *     tables only) the data as a second BLOB. Entries are compared on the key
 *     field alone: bytewise unsigned over the shorter length, then the
 *     shorter first; an insert whose key equals an entry's replaces it.
 *
 * Every function returns an SQLite result code unless it says otherwise.
 * Sizes are 32-bit: the binding refuses anything larger before calling. */
#ifndef KOVPAGER_ENGINE_SQLITE_BTREE_H
#define KOVPAGER_ENGINE_SQLITE_BTREE_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

struct sqlite3;

typedef struct KovsqTree KovsqTree;      /* the main B-tree of one connection */
typedef struct KovsqCursor KovsqCursor;  /* one B-tree cursor */

/* The private SQLite's temporary-directory setting. */
char **kovsq_temp_directory(void);

/* Wraps the main database of `db`, which must stay open until
 * kovsq_tree_close. Null when out of memory. */
KovsqTree *kovsq_tree_open(struct sqlite3 *db);
/* Frees the wrapper (every cursor must be closed first); `db` stays open. */
void kovsq_tree_close(KovsqTree *tree);

/* Creates an empty table and writes its root page. Needs the write
 * transaction and no open cursor. */
int kovsq_create_table(KovsqTree *tree, uint32_t *root, int intKey);
/* Drops a table made by kovsq_create_table. Needs the write transaction and
 * no open cursor. */
int kovsq_drop_table(KovsqTree *tree, uint32_t root);

/* Space. The temporary file holds room for the pages the database holds, reserved ahead, so that
 * writing out a page the cache holds never meets a full disk (engine/temp_file.h). Every insert
 * and every new table first makes sure of room for the pages held and for the most that call can
 * add; kovsq_reserve asks for more ahead. Until the database could outgrow half its cache no
 * page can be written out and there is no file; past that the file is made at once, in the
 * temporary directory, and room reserved in it.
 *
 * A call refused for room (SQLITE_FULL, or another I/O code the system gave) or because the file
 * could not be made (SQLITE_CANTOPEN) has changed nothing, and kovsq_refused then answers 1;
 * every other failure answers 0 (a failure SQLite met itself, inside the call). */

/* The file control that reserves room in a temporary file: its argument is an sqlite3_int64, the
 * bytes from the start of the file that must have room. */
#define KOVSQ_FCNTL_RESERVE 0x4b4f5601

/* Makes sure of room for `pages` pages in all. */
int kovsq_reserve(KovsqTree *tree, int64_t pages);
/* 1 when the last insert, table creation or reservation was refused as above. */
int kovsq_refused(const KovsqTree *tree);

/* The file control that gives back room past an sqlite3_int64 byte count, which must be at least
 * the end of every page the database holds. */
#define KOVSQ_FCNTL_RELEASE 0x4b4f5602

/* Gives back the room held past `pages` pages (the pages held and what is still wanted) and a
 * step, when that is more than another step: once a load is merged, the room held for its bound
 * is spent. Nothing happens when the file does not exist or the system refuses. */
void kovsq_release(KovsqTree *tree, int64_t pages);

typedef struct KovsqSpace {
    uint32_t pages;      /* pages in the database, free ones included */
    uint32_t freePages;  /* pages on the free list, used before the database grows */
    uint32_t usableSize; /* bytes of a page that hold cells */
} KovsqSpace;
void kovsq_space(KovsqTree *tree, KovsqSpace *space);

/* The most page bytes one entry takes in a B-tree whose pages are full (keySize 0 on an
 * integer-keyed table, dataSize 0 on a key-only one). */
uint64_t kovsq_entry_bound(KovsqTree *tree, int intKey, uint32_t keySize, uint32_t dataSize);

/* Empties a table, keeping its root page (so it can be filled again). No
 * cursor may stand on it. */
int kovsq_clear_table(KovsqTree *tree, uint32_t root);

/* SQLite's own integrity check of the whole file, given the root pages of
 * every table in it (the catalogue's page 1 is added here). Returns the
 * number of problems found (-1 when the check itself ran out of memory) and,
 * when there are any, their description in *report, to be freed with
 * kovsq_free. */
int kovsq_integrity_check(KovsqTree *tree, const uint32_t *roots, int nRoots, int maxErrors,
                          char **report);
void kovsq_free(void *p);

/* Opens a cursor on the table with the given root page, of the kind it was
 * created with. Needs a transaction (the write transaction for a writing
 * cursor). *cursor is null on failure. */
int kovsq_cursor_open(KovsqTree *tree, uint32_t root, int intKey, int write, KovsqCursor **cursor);
void kovsq_cursor_close(KovsqCursor *cursor);

/* Moves. First/Last set *empty to 1 for an empty table (the cursor is then
 * on no entry). Next/Previous return SQLITE_DONE when there was no following
 * or preceding entry, and the cursor is then on no entry. */
int kovsq_first(KovsqCursor *cursor, int *empty);
int kovsq_last(KovsqCursor *cursor, int *empty);
int kovsq_next(KovsqCursor *cursor);
int kovsq_previous(KovsqCursor *cursor);
/* Nonzero when the cursor is on an entry. */
int kovsq_valid(KovsqCursor *cursor);
/* Takes the cursor off its entry (no I/O, cannot fail). */
void kovsq_clear(KovsqCursor *cursor);

/* One search. *cmp: 0 = on an equal entry; negative = on an entry smaller
 * than the key, or on no entry when the table is empty; positive = on an
 * entry larger than the key. Which neighbour it lands on is the search's
 * (SQLite's descent for integer keys; for byte keys the same descent with a
 * comparison of the key field alone). */
int kovsq_seek_int(KovsqCursor *cursor, int64_t key, int *cmp);
int kovsq_seek_key(KovsqCursor *cursor, const void *key, uint32_t keySize, int *cmp);

/* Where an insert puts its entry:
 *   KOVSQ_SEARCH        wherever a search for its key leads (the cursor's
 *                       position does not matter);
 *   KOVSQ_AT_ENTRY      in place of the entry the cursor stands on, which a
 *                       search found equal to the key (no second search);
 *   KOVSQ_AFTER_ENTRY   right after the cursor's entry, KOVSQ_BEFORE_ENTRY
 *                       right before it: the cursor stands on a leaf where a
 *                       search for the key left it (or on the leaf neighbour
 *                       that kovsq_next_adjacent reached from there);
 *   KOVSQ_AT_END        after the table's last entry: the key is larger than
 *                       every key in the table (loads in key order). */
enum {
    KOVSQ_SEARCH = 0,
    KOVSQ_AT_ENTRY = 1,
    KOVSQ_AFTER_ENTRY = 2,
    KOVSQ_BEFORE_ENTRY = 3,
    KOVSQ_AT_END = 4
};

/* Inserts or replaces one entry. Afterwards the cursor's position is
 * SQLite's (use kovsq_valid only after a move). `key` must not be null;
 * `data` may be null when dataSize is 0. withData 0 stores no data field
 * (key-only tables). `at` as above; a wrong promise there damages the table. */
int kovsq_insert_int(KovsqCursor *cursor, int64_t key, const void *data, uint32_t dataSize,
                     int at);
int kovsq_insert_key(KovsqCursor *cursor, const void *key, uint32_t keySize, const void *data,
                     uint32_t dataSize, int withData, int at);

/* Next, also telling whether the entry reached is the leaf neighbour of the
 * one left (same leaf page): *adjacent is then 1, and an insert of a key
 * between the two may use KOVSQ_BEFORE_ENTRY. */
int kovsq_next_adjacent(KovsqCursor *cursor, int *adjacent);

/* Tells SQLite that the cursor's inserts come in key order (on) or not (off):
 * balancing then fills the pages it splits instead of halving them. */
void kovsq_bulk_load(KovsqCursor *cursor, int on);

/* The entry a cursor is on. The payload is the data on an integer-keyed
 * table and the record on the others; `local` points at the first
 * `localSize` bytes of it on the cached page, valid until the cursor moves
 * or its table changes. */
typedef struct KovsqEntry {
    int64_t intKey;             /* integer-keyed tables only */
    const unsigned char *local; /* the payload's first localSize bytes */
    uint32_t localSize;
    uint32_t keyOffset;         /* where the key bytes start in the payload */
    uint32_t keySize;           /* 0 on integer-keyed tables */
    uint32_t dataSize;          /* the data follows the key bytes */
} KovsqEntry;

/* Describes the current entry; SQLITE_CORRUPT when its record is not one
 * this layout makes, SQLITE_MISUSE when the cursor is on no entry. */
int kovsq_entry(KovsqCursor *cursor, KovsqEntry *entry);
/* Copies amt payload bytes from offset, following overflow pages. */
int kovsq_read(KovsqCursor *cursor, uint32_t offset, uint32_t amt, void *buf);

#ifdef __cplusplus
}
#endif

#endif /* KOVPAGER_ENGINE_SQLITE_BTREE_H */
