// Loads sorted in runs: how inserts that nothing reads yet reach a table's B-tree.
//
// An insert into a B-tree that is larger than the page cache is a descent that misses the cache
// and a page written back later: two page transfers for one entry. The same entries in key order
// cost a small fraction of that, since each page is filled once and written once. So inserts into
// a table that nothing reads are gathered in memory (LoadBuffer); when the memory set aside for
// gathering is full, the largest buffer is sorted and written out as a run, a B-tree of the same
// layout built by appending (writeRun); before the table is next read, its runs and its buffer are
// merged in key order into its B-tree (mergeInto): by appending when every merged key is larger
// than the table's last one (an empty table always), by inserts in key order otherwise.
//
// Runs live in the same temporary database as the tables, so they share its lifetime (nothing is
// left when the process ends) and its page cache. A run's tree is emptied after its merge and kept
// for the next run, so its root page is not allocated again.
//
// Equal keys: the last entry inserted wins, as in the B-tree itself. Within the buffer the later
// insert wins (sortUnique), across runs the later run, and the buffer over every run.
//
// Nothing here knows the binding's rules or its cursors; engine/btree.cpp decides when to gather,
// spill and merge.
#ifndef KOVPAGER_ENGINE_SORTED_LOAD_H
#define KOVPAGER_ENGINE_SORTED_LOAD_H

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "engine/sqlite_btree.h"

namespace kov::engine {

// How a table's entries are laid out: integer or byte-string keys, with data or key only.
struct TableShape {
    bool intKey;
    bool withData;
};

// One entry as a load sees it: the integer key (integer-keyed tables) or the key bytes, and the
// data bytes, lent by whoever holds them.
struct LoadEntry {
    std::int64_t intKey;
    const unsigned char* key;
    std::uint32_t keySize;
    const unsigned char* data;
    std::uint32_t dataSize;
};

// Key order: integer keys as signed numbers; byte keys bytewise unsigned over the shorter length,
// then the shorter first. Negative, 0 or positive as `a` sorts before, with or after `b`.
int compareKeys(const TableShape& shape, const LoadEntry& a, const LoadEntry& b);

// Inserts one entry through an SQLite cursor on a table of that layout; `at` as in
// sqlite_btree.h. Null key and data pointers stand for empty ones.
int insertEntry(KovsqCursor* cursor, const TableShape& shape, const LoadEntry& e, int at);

// Entries gathered in memory for one table, in the order they were inserted, until sorted.
class LoadBuffer {
  public:
    explicit LoadBuffer(bool intKey) : intKey_(intKey) {}
    LoadBuffer(const LoadBuffer&) = delete;
    LoadBuffer& operator=(const LoadBuffer&) = delete;

    // The memory one entry takes here, bookkeeping included.
    static std::size_t footprint(std::uint32_t keySize, std::uint32_t dataSize);

    // Copies one entry in (key bytes are ignored on integer-keyed tables). Throws std::bad_alloc.
    void add(std::int64_t intKey, const void* key, std::uint32_t keySize, const void* data,
             std::uint32_t dataSize);

    // Sorts in key order and drops every entry that a later insert of an equal key replaces.
    void sortUnique();

    // True when the entries are in key order and unique: as they arrived, or after sortUnique().
    bool sorted() const { return inOrder_; }
    std::size_t size() const { return slots_.size(); }
    bool empty() const { return slots_.empty(); }
    // The sum of the footprints of the entries held.
    std::size_t bytes() const { return bytes_; }
    // The i-th entry: in insertion order before sortUnique(), in key order after.
    LoadEntry at(std::size_t i) const;

    // Empties the buffer and gives its memory back.
    void clear();

  private:
    struct Slot {
        std::uint64_t order;  // sorts as the key's first 8 bytes (or the integer key) do
        const unsigned char* record;
        std::uint32_t sequence;  // insertion order, for equal keys
    };
    unsigned char* allocate(std::size_t size);
    // Key order alone: negative, 0 or positive.
    int compareSlots(const Slot& a, const Slot& b) const;
    // Key order, then insertion order among equal keys.
    bool before(const Slot& a, const Slot& b) const;

    bool intKey_;
    std::vector<std::unique_ptr<unsigned char[]>> blocks_;
    std::size_t blockUsed_ = 0;
    std::size_t blockSize_ = 0;
    std::vector<Slot> slots_;
    std::size_t bytes_ = 0;
    bool inOrder_ = true;  // every key so far larger than the one before it
};

// What a table has gathered and not yet merged: its runs, oldest first, and its buffer.
struct PendingLoad {
    explicit PendingLoad(bool intKey) : buffer(intKey) {}
    LoadBuffer buffer;
    std::vector<std::uint32_t> runs;  // root pages of the run B-trees
    // What the load may still take in the file (engine/btree.cpp, "Space"): the page bytes of its
    // entries in the buffer and in the runs (kovsq_entry_bound), and whether its merge appends
    // (the table was empty when the load began, and nothing went into it since).
    std::uint64_t bufferBound = 0;
    std::uint64_t runBound = 0;
    bool mergeAppends = false;
};

// Writes the buffer's entries, which must be sorted and unique, into the empty B-tree `root` (of
// the table's layout) by appending. An SQLite result code.
int writeRun(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
             const LoadBuffer& buffer);

// Whether the buffer's keys (sorted) all lie above the last key of the table `root`: merging it
// is then appending, and cheaper than writing a run (a load in key order).
int appendsToTable(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
                   const LoadBuffer& buffer, bool* appends);

// Whether the table `root` holds no entry. An SQLite result code.
int tableIsEmpty(KovsqTree* tree, std::uint32_t root, const TableShape& shape, bool* empty);

// Merges the runs (oldest first) and the buffer (sorted and unique) into the table's B-tree
// `root`, the newest entry winning among equal keys; *appended tells whether it appended. An
// SQLite result code; after a failure the table holds what was merged before it.
int mergeInto(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
              const std::vector<std::uint32_t>& runs, const LoadBuffer& buffer, bool* appended);

}  // namespace kov::engine

#endif  // KOVPAGER_ENGINE_SORTED_LOAD_H
