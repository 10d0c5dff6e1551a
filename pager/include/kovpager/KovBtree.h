// KovBtree: one table of the store.
//
// Constructing a KovBtree creates a new, empty table in the process's store; destroying it drops
// the table again when it can. The object holds no records: they live in the engine and are read
// and written through KovBtreeCursor.
//
//   KovBtree people(KovBtree::BlobTable);      // byte-string keys, each with data
//   KovBtree byAge(KovBtree::IndexTable);      // key-only entries (composite index keys)
//   KovBtree rows(KovBtree::IntKeyTable);      // signed 64-bit keys, each with data
//
// Kinds. BlobTable (0) and IndexTable (2) order their keys bytewise unsigned, the shorter first
// when one is a prefix of the other; IntKeyTable (1) orders signed 64-bit keys numerically. Any
// value other than 0 and 1 makes a key-only table.
//
// Construction closes every open cursor of the process, keeping its position, creates the table
// and reopens every cursor on its key (see KovBtreeCursor for what that means to a cursor). After
// KovPager::reset() the first construction opens a fresh, empty engine.
//
// Destruction drops the table only while no cursor at all is open in the process; otherwise the
// table stays in the temporary file, unreachable, until the engine closes. Destroy the table after
// every cursor on it. A table made before KovPager::reset() is void; destroying it while the engine
// is closed does nothing.
//
// Thread safety: none; one thread at a time, like the whole store.
#ifndef KOVPAGER_KOVBTREE_H
#define KOVPAGER_KOVBTREE_H

#include <cstdint>

#include <kovpager/KovPager.h>

class KOVPAGER_EXPORT KovBtree {
  public:
    enum TableType : std::int32_t {
        BlobTable = 0,    // byte-string keys with data
        IntKeyTable = 1,  // signed 64-bit integer keys with data
        IndexTable = 2,   // byte-string keys only
    };

    // Creates an empty table of the given kind. Throws only allocation errors; then the host has
    // no table (one the engine made already stays, unreachable, until the engine closes) and
    // every cursor is open again on its entry, but one whose own reopening ran out of memory,
    // which answers as on no entry (as a refused cursor does).
    explicit KovBtree(TableType type);

    // Drops the table when no cursor is open anywhere in the process.
    ~KovBtree();

    // Two handles would drop the same table twice.
    KovBtree(const KovBtree&) = delete;
    KovBtree& operator=(const KovBtree&) = delete;

  private:
    friend class KovBtreeCursor;
    friend struct KovTestAccess;  // the unit tests only; never defined by the library

    KovPager* pager_;
    std::uint32_t rootPage_;
    std::uint32_t tableFlags_;
};

#endif  // KOVPAGER_KOVBTREE_H
