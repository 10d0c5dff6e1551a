// KovTestAccess: the unit tests' window on the private state of the three store classes.
//
// KovPager, KovBtree and KovBtreeCursor each name KovTestAccess as a friend, and the library never
// defines it: only this header does, so the members below exist in test programs alone and
// nothing of them is compiled into, or exported from, the shared library.
//
//   const auto& slots = KovTestAccess::slots();            // the cursor registry
//   EXPECT_EQ(KovTestAccess::engine(), nullptr);            // after reset() or teardown
//   std::uint32_t root = KovTestAccess::rootPage(table);
//
// Every member that takes no pager works on the process's pager (KovPager::instance(), which is
// constructed on the first use if it was not yet).
#ifndef KOVPAGER_TESTS_KOV_TEST_ACCESS_H
#define KOVPAGER_TESTS_KOV_TEST_ACCESS_H

#include <cstdint>
#include <string>
#include <vector>

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>

struct KovTestAccess {
    // --- KovPager ---

    // The store's page size in bytes and page-cache size in pages, as the pager hands them to
    // every engine it opens (constants: reading them constructs nothing).
    static std::int64_t defaultPageSize() { return KovPager::defaultPageSize_; }
    static std::int64_t defaultCacheSize() { return KovPager::defaultCacheSize_; }

    // The cursor registry.
    static const std::vector<kov::pager::CursorSlot>& slots() { return KovPager::instance()->cursorSlots_; }

    // The engine handle; null while the engine is closed.
    static kov::engine::Btree* engine() { return KovPager::instance()->engine_; }

    // The pager's own copy of the temporary directory (of `pager`, which may be a copy).
    static std::string& tempDir(KovPager* pager) { return pager->tempDir_; }

    // What the exit-time hook does to the process's pager.
    static void teardown() { KovPager::instance()->teardown(); }

    // The exit-time hook itself, as the runtime calls it at unload or exit. Unlike teardown(), it
    // does not construct the pager when it does not exist yet.
    static void atExit() { KovPager::atExit(); }

    static void closeAllCursors(std::vector<std::string>& saved) {
        KovPager::instance()->closeAllCursors(saved);
    }

    static void restoreAllCursors(const std::vector<std::string>& saved) {
        KovPager::instance()->restoreAllCursors(saved);
    }

    // Runs the destructor of a copy placement-constructed by a test with `new (storage)
    // KovPager(other)`; the private destructor is out of the test's reach. A copy shares
    // the engine and the engine cursors without owning them: they are detached first, so nothing
    // of the process's pager is closed. Does nothing for null and for the process's pager.
    static void disposeCopy(KovPager* copy) {
        if (copy == nullptr || copy == KovPager::instance())
            return;
        copy->engine_ = nullptr;
        copy->cursorSlots_.clear();
        copy->~KovPager();
    }

    // --- KovBtree ---

    // The table's root page (0 when the engine refused to create it).
    static std::uint32_t rootPage(const KovBtree& table) { return table.rootPage_; }

    // --- KovBtreeCursor: the private readers and the slot index ---

    static void key(KovBtreeCursor& c, void* buffer, std::uint64_t size) { c.key(buffer, size); }
    static std::int64_t keySize(KovBtreeCursor& c) { return c.keySize(); }
    static void dataBuf(KovBtreeCursor& c, void* buffer, std::uint64_t size) {
        c.dataBuf(buffer, size);
    }
    static bool indexKeyFetch(KovBtreeCursor& c, const void* prefix, std::uint64_t prefixSize,
                              void* payload, std::uint64_t payloadSize) {
        return c.indexKeyFetch(prefix, prefixSize, payload, payloadSize);
    }
    static std::uint64_t slotIndex(const KovBtreeCursor& c) { return c.slotIndex_; }
};

#endif  // KOVPAGER_TESTS_KOV_TEST_ACCESS_H
