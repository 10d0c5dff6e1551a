// One cursor suite run over the three table kinds: integer keys with data, byte-string keys
// with data, and key-only entries.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "pager_test_util.h"

using namespace kovtest;

namespace {

// Each kind maps a small number n to a key of its own, in the same order as n, and knows how to
// insert, seek and read that key.
struct IntKind {
    static constexpr KovBtree::TableType kType = KovBtree::IntKeyTable;
    static constexpr bool kHasData = true;
    static void put(KovBtreeCursor& c, int n, const std::string& data) {
        insertInt(c, static_cast<std::int64_t>(n) * 10 - 500, data);
    }
    static std::int32_t seek(KovBtreeCursor& c, int n) {
        return c.seek(static_cast<std::int64_t>(n) * 10 - 500);
    }
    // Between n and n + 1.
    static std::int32_t seekAfter(KovBtreeCursor& c, int n) {
        return c.seek(static_cast<std::int64_t>(n) * 10 - 495);
    }
    static int current(KovBtreeCursor& c) { return static_cast<int>((intKey(c) + 500) / 10); }
};

std::string textKey(int n) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "k%05d", n);
    return buf;
}

struct BlobKind {
    static constexpr KovBtree::TableType kType = KovBtree::BlobTable;
    static constexpr bool kHasData = true;
    static void put(KovBtreeCursor& c, int n, const std::string& data) {
        insertBytes(c, textKey(n), data);
    }
    static std::int32_t seek(KovBtreeCursor& c, int n) { return seekBytes(c, textKey(n)); }
    static std::int32_t seekAfter(KovBtreeCursor& c, int n) {
        return seekBytes(c, textKey(n) + "!");
    }
    static int current(KovBtreeCursor& c) { return std::stoi(byteKey(c).substr(1)); }
};

struct IndexKind {
    static constexpr KovBtree::TableType kType = KovBtree::IndexTable;
    static constexpr bool kHasData = false;
    static void put(KovBtreeCursor& c, int n, const std::string&) { insertKey(c, textKey(n)); }
    static std::int32_t seek(KovBtreeCursor& c, int n) { return seekBytes(c, textKey(n)); }
    static std::int32_t seekAfter(KovBtreeCursor& c, int n) {
        return seekBytes(c, textKey(n) + "!");
    }
    static int current(KovBtreeCursor& c) { return std::stoi(byteKey(c).substr(1)); }
};

template <typename Kind>
class CursorSuite : public StoreTest {
  protected:
    void SetUp() override {
        StoreTest::SetUp();
        table = std::make_unique<KovBtree>(Kind::kType);
    }
    void TearDown() override {
        table.reset();
        StoreTest::TearDown();
    }
    // Inserts the even numbers 0, 2, ..., 2 * (count - 1).
    void fillEven(KovBtreeCursor& c, int count) {
        for (int i = count - 1; i >= 0; --i)
            Kind::put(c, 2 * i, "d" + std::to_string(2 * i));
    }
    std::unique_ptr<KovBtree> table;
};

using Kinds = ::testing::Types<IntKind, BlobKind, IndexKind>;
// Names the instantiations after the table kinds (and gives the macro its optional argument,
// which -Wpedantic asks for).
struct KindNames {
    template <typename Kind>
    static std::string GetName(int) {
        if (Kind::kType == KovBtree::IntKeyTable)
            return "IntKeyTable";
        if (Kind::kType == KovBtree::BlobTable)
            return "BlobTable";
        return "IndexTable";
    }
};
TYPED_TEST_SUITE(CursorSuite, Kinds, KindNames);

TYPED_TEST(CursorSuite, FreshCursorIsOnNoEntry) {
    KovBtreeCursor c(*this->table, true);
    EXPECT_FALSE(c.good());
    EXPECT_EQ(intKey(c), 0);
    EXPECT_EQ(c.dataSize(), 0);
}

TYPED_TEST(CursorSuite, FirstAndLastOnEmptyTableAreFalse) {
    KovBtreeCursor c(*this->table, false);
    EXPECT_FALSE(c.first());
    EXPECT_FALSE(c.good());
    EXPECT_FALSE(c.last());
    EXPECT_FALSE(c.good());
}

TYPED_TEST(CursorSuite, NextFromLastIsFalseAndPreviousThenStaysFalse) {
    KovBtreeCursor c(*this->table, true);
    this->fillEven(c, 3);
    ASSERT_TRUE(c.last());
    EXPECT_EQ(TypeParam::current(c), 4);
    EXPECT_FALSE(c.next());
    EXPECT_FALSE(c.good());
    EXPECT_FALSE(c.previous());
    EXPECT_FALSE(c.good());
    ASSERT_TRUE(c.first());
    EXPECT_FALSE(c.previous());
    EXPECT_FALSE(c.good());
}

TYPED_TEST(CursorSuite, WalksInKeyOrderBothWays) {
    KovBtreeCursor c(*this->table, true);
    this->fillEven(c, 40);
    std::vector<int> forward;
    for (bool on = c.first(); on; on = c.next())
        forward.push_back(TypeParam::current(c));
    std::vector<int> backward;
    for (bool on = c.last(); on; on = c.previous())
        backward.push_back(TypeParam::current(c));
    ASSERT_EQ(forward.size(), 40u);
    for (int i = 0; i < 40; ++i) {
        EXPECT_EQ(forward[i], 2 * i);
        EXPECT_EQ(backward[i], 78 - 2 * i);
    }
}

TYPED_TEST(CursorSuite, SeekReportsWhereItStands) {
    KovBtreeCursor c(*this->table, true);
    EXPECT_LT(TypeParam::seek(c, 4), 0);  // empty table
    EXPECT_FALSE(c.good());
    this->fillEven(c, 5);  // 0 2 4 6 8
    EXPECT_EQ(TypeParam::seek(c, 4), 0);
    EXPECT_TRUE(c.good());
    EXPECT_EQ(TypeParam::current(c), 4);
    EXPECT_GT(TypeParam::seekAfter(c, 4), 0);  // between 4 and 6: on the larger
    EXPECT_EQ(TypeParam::current(c), 6);
    EXPECT_LT(TypeParam::seekAfter(c, 8), 0);  // past everything: on the largest
    EXPECT_TRUE(c.good());
    EXPECT_EQ(TypeParam::current(c), 8);
    EXPECT_GT(TypeParam::seek(c, -1), 0);  // before everything: on the smallest
    EXPECT_EQ(TypeParam::current(c), 0);
}

TYPED_TEST(CursorSuite, InsertingAnEqualKeyReplacesTheEntry) {
    KovBtreeCursor c(*this->table, true);
    TypeParam::put(c, 7, "first");
    TypeParam::put(c, 7, "second!");
    ASSERT_TRUE(c.first());
    EXPECT_EQ(TypeParam::current(c), 7);
    if (TypeParam::kHasData) {
        EXPECT_EQ(dataOf(c), "second!");
    } else {
        EXPECT_EQ(c.dataSize(), 0);
    }
    EXPECT_FALSE(c.next());
}

TYPED_TEST(CursorSuite, EveryCursorOnTheTableIsOnNoEntryAfterAnInsert) {
    KovBtreeCursor a(*this->table, true);
    KovBtreeCursor b(*this->table, true);
    this->fillEven(a, 3);
    ASSERT_TRUE(a.first());
    ASSERT_TRUE(b.last());
    TypeParam::put(a, 1, "x");
    EXPECT_FALSE(a.good());
    EXPECT_FALSE(b.good());
    EXPECT_EQ(intKey(b), 0);
}

TYPED_TEST(CursorSuite, InsertThroughReadCursorAddsNothing) {
    {
        KovBtreeCursor reader(*this->table, false);
        TypeParam::put(reader, 3, "no");
        EXPECT_FALSE(reader.first());
    }
    KovBtreeCursor w(*this->table, true);
    EXPECT_FALSE(w.first());
}

TYPED_TEST(CursorSuite, ReaderLocksWritersOutAndRefusedWriterIsHarmless) {
    KovBtreeCursor w(*this->table, true);
    this->fillEven(w, 2);
    {
        KovBtreeCursor reader(*this->table, false);
        KovBtreeCursor refused(*this->table, true);
        expectRefusedWriter(refused);
        EXPECT_LT(TypeParam::seek(refused, 0), 0);
        EXPECT_EQ(intKey(refused), 0);
        EXPECT_EQ(refused.dataSize(), 0);
        EXPECT_FALSE(refused.indexKeySeek("", 0));
        TypeParam::put(refused, 9, "refused");
        TypeParam::put(w, 11, "locked out");
        ASSERT_TRUE(reader.last());
        EXPECT_EQ(TypeParam::current(reader), 2);
    }
    // Both readers gone: the writer writes again.
    TypeParam::put(w, 11, "now");
    ASSERT_TRUE(w.last());
    EXPECT_EQ(TypeParam::current(w), 11);
}

TYPED_TEST(CursorSuite, SizesReadZeroOnNoEntry) {
    KovBtreeCursor c(*this->table, true);
    this->fillEven(c, 2);
    ASSERT_TRUE(c.last());
    ASSERT_FALSE(c.next());
    EXPECT_EQ(intKey(c), 0);
    EXPECT_EQ(c.dataSize(), 0);
    EXPECT_EQ(KovTestAccess::keySize(c), 0);
    std::string buf(4, '.');
    c.data(buf.data(), 1);
    EXPECT_EQ(buf, "....");
}

TYPED_TEST(CursorSuite, DataReadsBackAsInserted) {
    KovBtreeCursor c(*this->table, true);
    this->fillEven(c, 20);
    for (int i = 0; i < 20; ++i) {
        ASSERT_EQ(TypeParam::seek(c, 2 * i), 0);
        if (TypeParam::kHasData) {
            EXPECT_EQ(dataOf(c), "d" + std::to_string(2 * i));
        } else {
            EXPECT_EQ(c.dataSize(), 0);
        }
    }
}

// The views read the same bytes as the copying members: the key's bytes (none for integer
// keys), the data's (none on key-only tables), also for data long enough to run onto overflow
// pages; both empty on no entry.
TYPED_TEST(CursorSuite, ViewsReadTheEntryInPlace) {
    KovBtreeCursor c(*this->table, true);
    const std::string big(9000, 'b');
    for (int i = 0; i < 40; ++i)
        TypeParam::put(c, i, i % 7 == 3 ? big + std::to_string(i) : "d" + std::to_string(i));
    EXPECT_TRUE(c.keyView().empty());
    EXPECT_TRUE(c.dataView().empty());
    int seen = 0;
    for (bool on = c.first(); on; on = c.next()) {
        const std::string_view key = c.keyView();
        const std::string_view data = c.dataView();
        if (TypeParam::kType == KovBtree::IntKeyTable) {
            EXPECT_TRUE(key.empty());
        } else {
            EXPECT_EQ(std::string(key), byteKey(c));
        }
        if (TypeParam::kHasData) {
            EXPECT_EQ(std::string(data), dataOf(c));
            EXPECT_EQ(data.size(), static_cast<std::size_t>(c.dataSize()));
        } else {
            EXPECT_TRUE(data.empty());
        }
        ++seen;
    }
    EXPECT_EQ(seen, 40);
    EXPECT_TRUE(c.keyView().empty());  // past the end
    EXPECT_TRUE(c.dataView().empty());
}

TYPED_TEST(CursorSuite, CursorsKeepTheirEntriesWhenTablesAreCreated) {
    KovBtreeCursor w(*this->table, true);
    this->fillEven(w, 30);
    KovBtreeCursor a(*this->table, false);
    KovBtreeCursor b(*this->table, false);
    ASSERT_EQ(TypeParam::seek(a, 14), 0);
    ASSERT_TRUE(b.last());
    ASSERT_TRUE(w.first());
    for (auto kind : {KovBtree::IntKeyTable, KovBtree::BlobTable, KovBtree::IndexTable}) {
        KovBtree made(kind);
        EXPECT_EQ(TypeParam::current(a), 14);
        EXPECT_EQ(TypeParam::current(b), 58);
        EXPECT_EQ(TypeParam::current(w), 0);
    }
    ASSERT_TRUE(a.next());
    EXPECT_EQ(TypeParam::current(a), 16);
}

TYPED_TEST(CursorSuite, ManyCursorsGrowTheRegistryAndEachKeepsItsSlot) {
    KovBtreeCursor w(*this->table, true);
    this->fillEven(w, 10);
    std::vector<std::unique_ptr<KovBtreeCursor>> cursors;
    for (int i = 0; i < 100; ++i) {
        cursors.push_back(std::make_unique<KovBtreeCursor>(*this->table, true));
        ASSERT_EQ(KovTestAccess::slotIndex(*cursors.back()), static_cast<std::uint64_t>(i + 1));
        TypeParam::seek(*cursors.back(), 2 * (i % 10));
    }
    for (int i = 0; i < 100; ++i)
        EXPECT_EQ(TypeParam::current(*cursors[i]), 2 * (i % 10));
    EXPECT_EQ(KovTestAccess::slots().size(), 101u);
    cursors.clear();
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);
}

}  // namespace
