// The cursor registry: the record of every open cursor, which lets tables be created while cursors
// stay open. Every change to it goes through the functions here; KovPager holds the slots
// (cursorSlots_), KovBtreeCursor names its slot by index, KovBtree creates its table through
// createTable().
//
// Why it exists: the engine creates (and drops) no table while any cursor is open on the database.
// So a table is created with every cursor closed around it: each live cursor's position is kept as
// its key, the table is made, and every cursor is reopened (as a writing cursor) and moved back to
// that key, which lands on it when it still exists.
//
// Slot states (checked with assert in debug builds at every change, by check()):
//
//   state                   cursor        rootPage
//   live, open              engine cursor table's root
//   live, refused           null          table's root   (the engine refused the cursor, or could
//                                                         not reopen it after a table creation)
//   live, closed            null          table's root   (inside createTable only)
//   live, stale             inert cursor  table's root   (after reset(); freed by the next
//                                                         closeAll or by the pager's teardown)
//   free                    null          CursorSlot::freeSlot_
//
// Invariants: slots are appended, never reused; only trailing free slots are removed, so the index
// of a live slot never changes and the last slot is never free. A free slot holds no engine
// cursor; no engine cursor is named by two slots (each slot closes its own). A slot is released
// only while the engine is open. A throw (an allocation) anywhere here leaves every slot in one
// of the states above outside createTable: closeAll allocates before it closes anything, every
// closed cursor is reopened on its key, and only one whose own reopening ran out of memory is
// left "refused"; none stays "closed".
#ifndef KOVPAGER_PAGER_CURSOR_REGISTRY_H
#define KOVPAGER_PAGER_CURSOR_REGISTRY_H

#include <kovpager/KovPager.h>

#include <cstdint>
#include <string>
#include <vector>

namespace kov::pager {

class CursorRegistry {
  public:
    using Slots = std::vector<CursorSlot>;

    // Whether the slot's table has integer keys (bit 0 of its engine flags).
    static bool hasIntegerKeys(const CursorSlot& slot) { return (slot.tableFlags & 1u) != 0; }
    static bool isFree(const CursorSlot& slot) { return slot.rootPage == CursorSlot::freeSlot_; }

    // Appends a live slot for a cursor on the table (root, flags) and opens its engine cursor
    // (reading or writing); returns the slot's index. A refused cursor leaves the slot "refused".
    static std::uint64_t add(KovPager& pager, std::uint32_t root, std::uint32_t flags, bool write);

    // Frees the slot: closes its engine cursor and removes trailing free slots. With the engine
    // closed (reset, or the exit-time teardown) nothing changes.
    static void release(KovPager& pager, std::uint64_t index);

    // The slot at `index`, or null past the end (the registry is emptied by the pager's
    // teardown).
    static const CursorSlot* at(const Slots& slots, std::uint64_t index) {
        return index < slots.size() ? &slots[index] : nullptr;
    }

    // Creates a table with the given engine flags, every cursor closed around it; returns its
    // root page (0 when the engine refused). Throws only allocation errors, and then every cursor
    // is open again as above (a table made before the throw stays, unreachable, until the engine
    // closes).
    static std::uint32_t createTable(KovPager& pager, std::uint32_t flags);

    // KovPager::closeAllCursors and restoreAllCursors: close every live cursor, keeping its key in
    // `saved` (index-aligned with the slots: 8 native-order bytes of an integer key, or the whole
    // byte-string key; a cursor on no entry keeps 0 or the empty key; a free slot's element is
    // left as it is), and reopen them all on their keys, as writing cursors. closeAll makes room
    // for every key before it closes any cursor, so a throw closes none; restoreAll tries every
    // slot before it throws.
    static void closeAll(Slots& slots, std::vector<std::string>& saved);
    static void restoreAll(kov::engine::Btree* engine, Slots& slots,
                           const std::vector<std::string>& saved);

    // The invariants above; `closed`: inside createTable, between closeAll and restoreAll.
    static void check(const Slots& slots, bool closed = false);
};

}  // namespace kov::pager

#endif  // KOVPAGER_PAGER_CURSOR_REGISTRY_H
