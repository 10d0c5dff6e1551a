// The cursor registry (CursorRegistry.h): slot bookkeeping and the close-create-restore sequence.
#include "pager/CursorRegistry.h"

#include <cassert>
#include <cstring>
#include <new>
#include <unordered_set>

#include "engine/btree.h"

namespace eng = kov::engine;

namespace kov::pager {

namespace {

// Makes `key` the size of the key a live slot's cursor stands on, and for an integer key stores
// it: the part of closeAll that allocates (a byte-string key's bytes are read afterwards).
void sizeKey(const CursorSlot& slot, std::string& key) {
    std::int64_t size = 0;
    eng::sqlite3BtreeKeySize(slot.cursor, &size);
    if (CursorRegistry::hasIntegerKeys(slot)) {
        key.resize(sizeof size);
        std::memcpy(key.data(), &size, sizeof size);
        return;
    }
    // A slot registered before a reset may have been reopened on an integer-keyed table of the
    // new engine; its "size" is then an integer key. The engine refuses a byte read on such a
    // table, even of zero bytes: the key is then kept as empty.
    if (size > 0 && eng::sqlite3BtreeKey(slot.cursor, 0, 0, nullptr) != eng::SQLITE_OK)
        size = 0;
    key.resize(size > 0 ? static_cast<std::size_t>(size) : 0);
}

// Reopens one slot as a writing cursor on its saved key.
void reopenSlot(eng::Btree* engine, CursorSlot& slot, const std::string& key) {
    eng::sqlite3BtreeCursor(engine, slot.rootPage, 1, nullptr, nullptr, &slot.cursor);
    int compare = 0;
    if (CursorRegistry::hasIntegerKeys(slot)) {
        std::int64_t intKey = 0;
        std::memcpy(&intKey, key.data(), key.size() < sizeof intKey ? key.size() : sizeof intKey);
        eng::sqlite3BtreeMoveto(slot.cursor, nullptr, intKey, &compare);
    } else {
        eng::sqlite3BtreeMoveto(slot.cursor, key.data(), static_cast<std::int64_t>(key.size()),
                                &compare);
    }
}

// Reopens every live slot. An allocation that fails for one slot (it is then "refused") does not
// stop the others; the failure is thrown again once every slot has been tried.
void reopen(eng::Btree* engine, CursorRegistry::Slots& slots,
            const std::vector<std::string>& saved) {
    bool failed = false;
    const std::string empty;
    for (std::size_t i = 0; i < slots.size(); ++i) {
        CursorSlot& slot = slots[i];
        if (CursorRegistry::isFree(slot))
            continue;
        try {
            reopenSlot(engine, slot, i < saved.size() ? saved[i] : empty);
        } catch (const std::bad_alloc&) {
            // Opened, perhaps, but not on its key: refused rather than somewhere else.
            if (slot.cursor != nullptr)
                eng::sqlite3BtreeCloseCursor(slot.cursor);
            slot.cursor = nullptr;
            failed = true;
        }
    }
    CursorRegistry::check(slots);
    if (failed)
        throw std::bad_alloc();
}

}  // namespace

std::uint64_t CursorRegistry::add(KovPager& pager, std::uint32_t root, std::uint32_t flags,
                                  bool write) {
    Slots& slots = pager.cursorSlots_;
    const std::uint64_t index = slots.size();
    slots.push_back(CursorSlot{nullptr, root, flags});
    eng::sqlite3BtreeCursor(pager.openEngine(), root, write ? 1 : 0, nullptr, nullptr,
                            &slots[index].cursor);
    return index;
}

void CursorRegistry::release(KovPager& pager, std::uint64_t index) {
    if (pager.openEngine() == nullptr)
        return;
    Slots& slots = pager.cursorSlots_;
    if (index >= slots.size())
        return;
    CursorSlot& slot = slots[index];
    if (slot.cursor != nullptr)
        eng::sqlite3BtreeCloseCursor(slot.cursor);
    slot.cursor = nullptr;
    slot.rootPage = CursorSlot::freeSlot_;
    while (!slots.empty() && isFree(slots.back()))
        slots.pop_back();
    assert(slots.empty() || !isFree(slots.back()));
}

std::uint32_t CursorRegistry::createTable(KovPager& pager, std::uint32_t flags) {
    std::vector<std::string> saved;
    pager.closeAllCursors(saved);  // a throw here closes nothing
    std::uint32_t root = 0;
    try {
        eng::sqlite3BtreeCreateTable(pager.engine_, &root, static_cast<int>(flags));
    } catch (...) {
        pager.restoreAllCursors(saved);
        throw;
    }
    pager.restoreAllCursors(saved);
    return root;
}

void CursorRegistry::closeAll(Slots& slots, std::vector<std::string>& saved) {
    check(slots);
    // Room for every key first (the allocations, which may throw: then no cursor is closed),
    // then each key read and its cursor closed (neither allocates).
    saved.resize(slots.size());
    for (std::size_t i = 0; i < slots.size(); ++i) {
        if (!isFree(slots[i]))
            sizeKey(slots[i], saved[i]);
    }
    for (std::size_t i = 0; i < slots.size(); ++i) {
        CursorSlot& slot = slots[i];
        if (isFree(slot))
            continue;
        if (!hasIntegerKeys(slot) && !saved[i].empty())
            eng::sqlite3BtreeKey(slot.cursor, 0, static_cast<std::uint32_t>(saved[i].size()),
                                 saved[i].data());
        if (slot.cursor != nullptr)
            eng::sqlite3BtreeCloseCursor(slot.cursor);
        slot.cursor = nullptr;
    }
    check(slots, true);
}

void CursorRegistry::restoreAll(eng::Btree* engine, Slots& slots,
                                const std::vector<std::string>& saved) {
    reopen(engine, slots, saved);
}

void CursorRegistry::check(const Slots& slots, bool closed) {
#ifndef NDEBUG
    std::unordered_set<const eng::BtCursor*> seen;
    for (const CursorSlot& slot : slots) {
        assert(!isFree(slot) || slot.cursor == nullptr);
        assert(!closed || slot.cursor == nullptr);
        assert(slot.cursor == nullptr || seen.insert(slot.cursor).second);
    }
    assert(slots.empty() || !isFree(slots.back()));
#else
    (void)slots;
    (void)closed;
#endif
}

}  // namespace kov::pager
