// The cursor registry around a table creation that runs out of memory: every allocation of the
// program can be made to fail (this program replaces the global operator new), and a table is
// created with the n-th allocation failing, for every n until one succeeds. After each throw no
// slot may stay closed: every cursor is open again on the entry it stood on, but the one whose own
// reopening the failure hit.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "pager_test_util.h"

namespace {

// Allocations still allowed before one fails; negative: none fails.
long gAllocationsLeft = -1;

}  // namespace

// The replacement pair allocates with malloc and frees with free; GCC, seeing both inlined, would
// take them for a mismatched pair.
#if defined(__GNUC__) && !defined(__clang__)
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"
#endif

void* operator new(std::size_t size) {
    if (gAllocationsLeft == 0) {
        gAllocationsLeft = -1;
        throw std::bad_alloc();
    }
    if (gAllocationsLeft > 0)
        --gAllocationsLeft;
    if (void* p = std::malloc(size == 0 ? 1 : size))
        return p;
    throw std::bad_alloc();
}

void operator delete(void* p) noexcept { std::free(p); }
void operator delete(void* p, std::size_t) noexcept { std::free(p); }

namespace {

using namespace kovtest;

// The store reset, with no cursor left (StoreTest), for each test.
class PagerRegistry : public StoreTest {};

TEST_F(PagerRegistry, AThrowDuringATableCreationLeavesEveryCursorOnItsEntry) {
    KovBtree bytes(KovBtree::BlobTable);
    KovBtree ints(KovBtree::IntKeyTable);
    std::vector<std::unique_ptr<KovBtreeCursor>> cursors;
    std::vector<std::string> keys;
    {
        KovBtreeCursor w(bytes, true);
        for (int i = 0; i < 8; ++i) {
            // Long keys: keeping one for the creation allocates.
            keys.push_back(std::string(40, static_cast<char>('a' + i)));
            insertBytes(w, keys.back(), "d");
        }
        KovBtreeCursor wi(ints, true);
        for (std::int64_t k = 0; k < 8; ++k)
            insertInt(wi, k * 100, "d");
    }
    for (int i = 0; i < 8; ++i) {
        cursors.push_back(std::make_unique<KovBtreeCursor>(bytes, false));
        ASSERT_EQ(seekBytes(*cursors.back(), keys[i]), 0);
    }
    auto intCursor = std::make_unique<KovBtreeCursor>(ints, false);
    ASSERT_EQ(intCursor->seek(std::int64_t{500}), 0);

    int threw = 0;
    for (long n = 0;; ++n) {
        gAllocationsLeft = n;
        bool made = false;
        try {
            KovBtree table(KovBtree::IndexTable);
            made = true;
        } catch (const std::bad_alloc&) {
            ++threw;
        }
        gAllocationsLeft = -1;
        // One allocation failed: at most the one cursor whose own reopening it hit is off its
        // entry; every other stands where it stood.
        int off = 0;
        for (int i = 0; i < 8; ++i) {
            if (!cursors[i]->good()) {
                ++off;
                continue;
            }
            EXPECT_EQ(byteKey(*cursors[i]), keys[i]) << "after allocation " << n;
        }
        if (intCursor->good()) {
            EXPECT_EQ(intKey(*intCursor), 500) << "after allocation " << n;
        } else {
            ++off;
        }
        EXPECT_LE(off, 1) << "after allocation " << n;
        if (made) {
            EXPECT_EQ(off, 0);
            break;
        }
        // The next round starts as this one did: a refused cursor lost its place (the next
        // creation reopens it on no key), so every cursor is put back on its entry.
        { KovBtree reopensEveryCursor(KovBtree::IndexTable); }
        for (int i = 0; i < 8; ++i)
            ASSERT_EQ(seekBytes(*cursors[i], keys[i]), 0);
        ASSERT_EQ(intCursor->seek(std::int64_t{500}), 0);
    }
    // The creation allocates for the keys it keeps: the failures reached it.
    EXPECT_GE(threw, 9);
    intCursor.reset();
    cursors.clear();
}

}  // namespace
