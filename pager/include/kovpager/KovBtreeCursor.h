// KovBtreeCursor: a position in one table, the only way to read, search and fill it.
//
//   KovBtree rows(KovBtree::IntKeyTable);
//   KovBtreeCursor cur(rows, true);            // true: a writing cursor
//   cur.insert(7, "seven", 5);
//   cur.insert(3, "three", 5);
//   for (bool on = cur.first(); on; on = cur.next()) {
//       std::int64_t key;
//       cur.key(key);
//       std::string value(static_cast<std::size_t>(cur.dataSize()), '\0');
//       cur.data(value.data(), value.size());
//   }
//
// A cursor is either on an entry or on no entry. It is on no entry when constructed and after a
// move past either end. After any insert into its table (by itself or by another cursor) its
// position is unspecified (this store leaves it on no entry): reposition with first(), last(),
// seek() or indexKeySeek() before reading. Reads are meaningful only while good() is true; on no
// entry the sizes read 0 and buffer reads copy nothing.
//
// Keys cross as a pointer and a byte count, integer keys as std::int64_t. Byte-string keys order
// bytewise unsigned, the shorter first when one is a prefix of the other.
//
// Read and writing cursors. A cursor made with write == false cannot insert, and while it is open
// its table refuses writers: a writing cursor constructed then is refused (all its operations do
// nothing and report no entry) and inserts through other cursors on that table add nothing.
//
// Table creation. Constructing any KovBtree closes every cursor of the process and reopens it,
// as a writing cursor, moved to its old key: integer keys and byte-string keys come back on the
// same entry. A cursor that was on no entry is moved to key 0 (or the empty key), so on a non-empty
// table it comes back on an entry. Read cursors come back as writing cursors.
//
// Lifetime: construct on an existing table; destroy before the table and before
// KovPager::reset(). A cursor destroyed after reset() leaves its registry slot in place.
//
// Thread safety: none; one thread at a time, like the whole store.
#ifndef KOVPAGER_KOVBTREECURSOR_H
#define KOVPAGER_KOVBTREECURSOR_H

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <kovpager/KovBtree.h>
#include <kovpager/KovPager.h>

class KOVPAGER_EXPORT KovBtreeCursor {
  public:
    // Registers a new cursor on `table`, on no entry. `write` chooses a writing cursor.
    // REQUIRES: `table` was made after the last KovPager::reset().
    KovBtreeCursor(const KovBtree& table, bool write);

    // Closes the cursor and releases its registry slot (unless the engine is closed).
    // Destroy cursors before their table: a table destroyed while any cursor is open is not
    // dropped and keeps its pages until the engine closes.
    ~KovBtreeCursor();

    KovBtreeCursor(const KovBtreeCursor&) = delete;
    KovBtreeCursor& operator=(const KovBtreeCursor&) = delete;

    // Moves to the first (last) entry. Returns true, on that entry, unless the table is empty;
    // false leaves the cursor on no entry.
    bool first();
    bool last();

    // Moves to the following (preceding) entry. Returns true when there is one; false leaves the
    // cursor on no entry, and a cursor on no entry stays there (false).
    bool next();
    bool previous();

    // True exactly when the cursor is on an entry.
    bool good();

    // Moves next to `key` and compares:
    //   0         on an entry equal to key
    //   negative  on the largest entry smaller than key; on no entry when the table is empty
    //   positive  on the smallest entry larger than key
    // The byte-string form is for BlobTable and IndexTable, the integer form for IntKeyTable; a
    // refused seek (wrong form, refused cursor, closed engine) returns a negative value and
    // leaves the cursor where it was.
    std::int32_t seek(const void* key, std::uint64_t size);
    std::int32_t seek(std::int64_t key);

    // Adds an entry, or replaces the one with an equal key (data included). Afterwards the
    // position of every cursor on the table is unspecified (on no entry, in this store). Adds
    // nothing through a read cursor or while a read cursor is open on the table.
    // Sizes: a data size is taken modulo 2^32 (its low 32 bits): 2^32 + 3 stores the first 3
    // bytes, 2^32 stores empty data. The insert adds nothing when that comes to more than
    // 1 000 000 000 bytes (2^31 and more included), and nothing for a key longer than
    // 1 000 000 000 bytes (key sizes are not cut). Neither buffer is read then.
    // REQUIRES: the form matching the table's kind (another form adds nothing).
    // Integer key with data (IntKeyTable):
    void insert(std::int64_t key, const void* data, std::uint64_t size);
    // Key only (IndexTable):
    void insert(const void* key, std::uint64_t size);
    // Byte-string key with data (BlobTable):
    void insert(const void* key, std::uint64_t keySize, const void* data, std::uint64_t dataSize);

    // Sets `key` to the integer key on an IntKeyTable, to the key's length in bytes otherwise;
    // 0 on no entry.
    // REQUIRES: good(), for a meaningful result.
    void key(std::int64_t& key);

    // Copies the first `size` bytes of the current entry's data into `buffer`. `size` is taken
    // modulo 2^32 (its low 32 bits): 2^32 + 4 copies 4 bytes, 2^32 copies nothing. Copies
    // nothing on no entry or when that exceeds dataSize(). The copy is the caller's: nothing a
    // cursor hands back refers to the store's memory.
    // REQUIRES: `buffer` holds `size` bytes; good(), for a meaningful result.
    void data(void* buffer, std::uint64_t size);

    // The current entry's data length in bytes; 0 on no entry and on key-only tables.
    std::int64_t dataSize();

    // The current entry's key bytes and data bytes where they lie in the store's memory, without
    // a copy. A view stays valid until this cursor moves or is destroyed, any insert into its
    // table (through any cursor), the construction of any KovBtree (which closes and reopens every
    // cursor) or KovPager::reset(), whichever comes first: copy what must live longer. Both are
    // empty on no entry; keyView() is empty on an IntKeyTable (its keys are numbers: key() reads
    // them), dataView() on an IndexTable. The copying members above read the same bytes.
    //   for (bool on = c.first(); on; on = c.next())
    //       use(c.keyView(), c.dataView());
    std::string_view keyView();
    std::string_view dataView();

    // Moves to the smallest entry whose key is not less than `key` (usually a prefix) and returns
    // true; false, on no entry, when every key is smaller. True says nothing about whether the
    // entry begins with `key`: ask indexKeyFetch.
    // REQUIRES: a BlobTable or an IndexTable.
    // A search the store refuses (a null `key`, or one longer than a key can be) does not move
    // the cursor, and the step that follows a search that stopped below the key is made from
    // where the cursor stood: it goes to the next entry and returns true, or returns false when
    // there is none (then on no entry). On an IntKeyTable, `size` is taken as the integer key.
    bool indexKeySeek(const void* key, std::uint64_t size);

    // True when the current key begins with the `prefixSize` bytes at `prefix`; `payload` is then
    // the rest of the key. False when it does not: `payload` has then been resized to the rest's
    // length and holds its old leading bytes padded with zero bytes. False, with `payload`
    // untouched, when the key is shorter than the prefix, and on an IntKeyTable (whose keys are
    // numbers, not bytes). On no entry the key reads as empty: a non-empty prefix gives false,
    // the empty prefix true with an empty payload.
    // A group of entries sharing a prefix is walked as
    //   for (bool on = c.indexKeySeek(p, n); on && c.indexKeyFetch(p, n, out); on = c.next()) ...
    bool indexKeyFetch(const void* prefix, std::uint64_t prefixSize, std::string& payload);

  private:
    friend struct KovTestAccess;  // the unit tests only; never defined by the library

    // Copies the first `size` bytes (taken modulo 2^32, as for data()) of key-then-data of a
    // byte-string entry; nothing on an integer-keyed table, on no entry, or when that exceeds
    // key plus data.
    void key(void* buffer, std::uint64_t size);

    // The key's length (the integer key on an IntKeyTable); 0 on no entry.
    std::int64_t keySize();

    // Same as data().
    void dataBuf(void* buffer, std::uint64_t size);

    // True when the current key is exactly prefixSize + payloadSize bytes long and begins with the
    // prefix; the payload bytes are then copied to `payload`. Otherwise copies nothing.
    bool indexKeyFetch(const void* prefix, std::uint64_t prefixSize, void* payload,
                       std::uint64_t payloadSize);

    // The engine cursor in this cursor's slot; null when refused or after the pager's teardown.
    kov::engine::BtCursor* handle() const;

    // The current key's bytes in place and their count: the empty key on no entry, null for a
    // cursor opened on an IntKeyTable or standing on an integer key.
    const unsigned char* currentKey(std::uint32_t& length);

    // True when `key` begins with the prefix; the payload that follows is then copied out.
    static bool matchAndCopy(const unsigned char* key, const void* prefix,
                             std::uint64_t prefixSize, void* payload, std::uint64_t payloadSize);

    std::vector<kov::pager::CursorSlot>* registry_;
    std::uint64_t slotIndex_;
};

#endif  // KOVPAGER_KOVBTREECURSOR_H
