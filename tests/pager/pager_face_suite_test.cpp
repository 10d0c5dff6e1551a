// The cursor suite's behaviours once more, through the C++17 face (<kovpager/kovpager.hpp>) and
// over its three tables: walks, lower_bound, replacing puts, reads back, views in place, walks
// that keep their place while tables are made, many walks at once.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

#include <kovpager/kovpager.hpp>

#include "pager_test_util.h"

using kovtest::StoreTest;

namespace {

std::string textKey(int n) {
    char buf[16];
    std::snprintf(buf, sizeof buf, "k%05d", n);
    return buf;
}

// Each kind maps a small number n to a key of its own, in the same order as n, puts and reads
// that key, and turns a walk's element back into its number.
struct IntFace {
    using Table = kovpager::IntTable;
    static constexpr bool kHasData = true;
    static std::int64_t key(int n) { return static_cast<std::int64_t>(n) * 10 - 500; }
    // Between n and n + 1.
    static std::int64_t keyAfter(int n) { return key(n) + 5; }
    static void put(Table& t, int n, const std::string& data) { t.put(key(n), data); }
    static std::optional<std::string> get(Table& t, int n) { return t.get(key(n)); }
    static std::optional<std::string_view> getView(Table& t, int n) { return t.get_view(key(n)); }
    template <typename Entry>
    static int number(const Entry& e) {
        return static_cast<int>((e.key() + 500) / 10);
    }
};

// The byte-string keys both byte tables use.
struct TextKeys {
    static std::string key(int n) { return textKey(n); }
    static std::string keyAfter(int n) { return textKey(n) + "!"; }
    template <typename Entry>
    static int number(const Entry& e) {
        return std::stoi(std::string(e.key().substr(1)));
    }
};

struct BytesFace : TextKeys {
    using Table = kovpager::BytesTable;
    static constexpr bool kHasData = true;
    static void put(Table& t, int n, const std::string& data) { t.put(key(n), data); }
    static std::optional<std::string> get(Table& t, int n) { return t.get(key(n)); }
    static std::optional<std::string_view> getView(Table& t, int n) { return t.get_view(key(n)); }
};

// Key-only: a present key reads as empty data.
struct IndexFace : TextKeys {
    using Table = kovpager::IndexTable;
    static constexpr bool kHasData = false;
    static void put(Table& t, int n, const std::string&) { t.put(key(n)); }
    static std::optional<std::string> get(Table& t, int n) {
        return t.contains(key(n)) ? std::optional<std::string>("") : std::nullopt;
    }
    static std::optional<std::string_view> getView(Table& t, int n) {
        return t.contains(key(n)) ? std::optional<std::string_view>("") : std::nullopt;
    }
};

template <typename Kind>
class FaceSuite : public StoreTest {
  protected:
    void SetUp() override {
        StoreTest::SetUp();
        table = std::make_unique<typename Kind::Table>();
    }
    void TearDown() override {
        table.reset();
        StoreTest::TearDown();
    }
    // Puts the even numbers 0, 2, ..., 2 * (count - 1), largest first.
    void fillEven(int count) {
        for (int i = count - 1; i >= 0; --i)
            Kind::put(*table, 2 * i, "d" + std::to_string(2 * i));
    }
    // The numbers a walk (a table, or a lower_bound or with_prefix range) passes, in order.
    template <typename Range>
    static std::vector<int> numbers(Range&& range) {
        std::vector<int> seen;
        for (const auto& e : range)
            seen.push_back(Kind::number(e));
        return seen;
    }
    static std::vector<int> evens(int from, int to) {
        std::vector<int> v;
        for (int n = from; n <= to; n += 2)
            v.push_back(n);
        return v;
    }
    std::unique_ptr<typename Kind::Table> table;
};

using Faces = ::testing::Types<IntFace, BytesFace, IndexFace>;
struct FaceNames {
    template <typename Kind>
    static std::string GetName(int) {
        if (std::is_same<Kind, IntFace>::value)
            return "IntTable";
        if (std::is_same<Kind, BytesFace>::value)
            return "BytesTable";
        return "IndexTable";
    }
};
TYPED_TEST_SUITE(FaceSuite, Faces, FaceNames);

TYPED_TEST(FaceSuite, FreshTableWalksNothingAndHoldsNoKey) {
    EXPECT_FALSE(this->table->begin() != this->table->end());
    EXPECT_TRUE(this->numbers(*this->table).empty());
    EXPECT_TRUE(this->numbers(this->table->lower_bound(TypeParam::key(0))).empty());
    EXPECT_EQ(TypeParam::get(*this->table, 0), std::nullopt);
    EXPECT_EQ(TypeParam::getView(*this->table, 0), std::nullopt);
}

TYPED_TEST(FaceSuite, WalksInKeyOrder) {
    this->fillEven(40);
    EXPECT_EQ(this->numbers(*this->table), this->evens(0, 78));
    EXPECT_EQ(this->numbers(*this->table), this->evens(0, 78));  // a second walk, from the start
}

TYPED_TEST(FaceSuite, LowerBoundStartsAtTheFirstKeyNotLess) {
    EXPECT_TRUE(this->numbers(this->table->lower_bound(TypeParam::key(4))).empty());
    this->fillEven(5);  // 0 2 4 6 8
    EXPECT_EQ(this->numbers(this->table->lower_bound(TypeParam::key(4))), this->evens(4, 8));
    EXPECT_EQ(this->numbers(this->table->lower_bound(TypeParam::keyAfter(4))), this->evens(6, 8));
    EXPECT_TRUE(this->numbers(this->table->lower_bound(TypeParam::keyAfter(8))).empty());
    EXPECT_EQ(this->numbers(this->table->lower_bound(TypeParam::key(-1))), this->evens(0, 8));
}

TYPED_TEST(FaceSuite, PuttingAnEqualKeyReplacesTheEntry) {
    TypeParam::put(*this->table, 7, "first");
    TypeParam::put(*this->table, 7, "second!");
    EXPECT_EQ(this->numbers(*this->table), std::vector<int>{7});
    EXPECT_EQ(TypeParam::get(*this->table, 7),
              std::optional<std::string>(TypeParam::kHasData ? "second!" : ""));
}

TYPED_TEST(FaceSuite, DataReadsBackAsPut) {
    this->fillEven(20);
    for (int i = 0; i < 20; ++i) {
        const std::string want = TypeParam::kHasData ? "d" + std::to_string(2 * i) : "";
        EXPECT_EQ(TypeParam::get(*this->table, 2 * i), std::optional<std::string>(want));
        EXPECT_EQ(TypeParam::getView(*this->table, 2 * i), std::optional<std::string_view>(want));
        EXPECT_EQ(TypeParam::get(*this->table, 2 * i + 1), std::nullopt);
    }
}

// A walk's views read the entry in place: the key's bytes (the integer for IntTable), the data's
// (none on IndexTable), also for data long enough to run onto overflow pages.
TYPED_TEST(FaceSuite, ViewsReadTheEntryInPlace) {
    const std::string big(9000, 'b');
    auto dataOf = [&](int i) { return i % 7 == 3 ? big + std::to_string(i) : "d" + std::to_string(i); };
    for (int i = 0; i < 40; ++i)
        TypeParam::put(*this->table, i, dataOf(i));
    int seen = 0;
    for (const auto& e : *this->table) {
        EXPECT_EQ(e.key(), TypeParam::key(seen));
        EXPECT_EQ(e.data(), TypeParam::kHasData ? dataOf(seen) : "");
        ++seen;
    }
    EXPECT_EQ(seen, 40);
}

TYPED_TEST(FaceSuite, WalksKeepTheirPlaceWhenTablesAreCreated) {
    this->fillEven(30);
    auto a = this->table->lower_bound(TypeParam::key(14)).begin();
    auto b = this->table->begin();
    ASSERT_TRUE(a != this->table->end());
    ASSERT_TRUE(b != this->table->end());
    {
        kovpager::IntTable ints;
        kovpager::BytesTable bytes;
        kovpager::IndexTable keys;
        ints.put(1, "x");
        EXPECT_EQ(TypeParam::number(*a), 14);
        EXPECT_EQ(TypeParam::number(*b), 0);
    }
    ++a;
    ++b;
    EXPECT_EQ(TypeParam::number(*a), 16);
    EXPECT_EQ(TypeParam::number(*b), 2);
}

TYPED_TEST(FaceSuite, ManyWalksAtOnceEachKeepItsPlace) {
    this->fillEven(10);
    using Walk = decltype(this->table->begin());
    std::vector<Walk> walks;
    for (int i = 0; i < 100; ++i)
        walks.push_back(this->table->lower_bound(TypeParam::key(2 * (i % 10))).begin());
    // The table's writing cursor and one cursor per walk.
    EXPECT_EQ(KovTestAccess::slots().size(), 101u);
    for (int i = 0; i < 100; ++i) {
        ASSERT_TRUE(walks[i] != this->table->end());
        EXPECT_EQ(TypeParam::number(*walks[i]), 2 * (i % 10));
    }
    walks.clear();
    EXPECT_EQ(KovTestAccess::slots().size(), 1u);
}

}  // namespace
