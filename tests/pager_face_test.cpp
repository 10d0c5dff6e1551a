// The C++17 face (<kovpager/kovpager.hpp>): put, get and contains, range-for walks, lower_bound
// and with_prefix on the three tables, checked against std::map models with random operations;
// views compared byte for byte; moves; failed(), failure() and reset() forwarded.
#include <gtest/gtest.h>

#include <cstdint>
#include <map>
#include <random>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include <kovpager/kovpager.hpp>

#include "pager_test_util.h"

using kovtest::StoreTest;

// The store reset, with a table made and no cursor left (StoreTest), for each test.
class Face : public StoreTest {};

namespace {

std::string randomBytes(std::mt19937& rng, std::size_t most) {
    // Few distinct letters, so that keys share prefixes and equal keys come back; a byte above
    // 0x7f now and then, so that the order is unsigned.
    static const char letters[] = {'a', 'b', 'c', '\x00', '\xff'};
    std::string s(rng() % (most + 1), 'a');
    for (char& ch : s)
        ch = letters[rng() % 5];
    return s;
}

template <typename Table>
std::vector<std::pair<std::string, std::string>> walkAll(Table& table) {
    std::vector<std::pair<std::string, std::string>> rows;
    for (const auto& e : table)
        rows.emplace_back(std::string(e.key()), std::string(e.data()));
    return rows;
}

}  // namespace

// Random puts into a BytesTable (some with data long enough for overflow pages), checked with
// get, whole walks, lower_bound and with_prefix walks against a std::map.
TEST_F(Face, BytesTableMatchesAMap) {
    kovpager::BytesTable table;
    std::map<std::string, std::string> model;
    std::mt19937 rng(3);
    for (int step = 0; step < 3000; ++step) {
        const std::string key = randomBytes(rng, 6);
        if (rng() % 3 != 0) {
            std::string data = randomBytes(rng, 20);
            if (rng() % 50 == 0)
                data.append(6000, 'o');
            table.put(key, data);
            model[key] = data;
        } else {
            const std::optional<std::string> got = table.get(key);
            const auto it = model.find(key);
            ASSERT_EQ(got.has_value(), it != model.end()) << step;
            if (got.has_value()) {
                ASSERT_EQ(*got, it->second) << step;
            }
        }
        if (step % 500 == 499) {
            ASSERT_EQ(walkAll(table),
                      (std::vector<std::pair<std::string, std::string>>(model.begin(),
                                                                         model.end())));
            const std::string from = randomBytes(rng, 3);
            std::vector<std::pair<std::string, std::string>> want(model.lower_bound(from),
                                                                  model.end());
            std::vector<std::pair<std::string, std::string>> got;
            for (const auto& e : table.lower_bound(from))
                got.emplace_back(std::string(e.key()), std::string(e.data()));
            ASSERT_EQ(got, want) << "lower_bound";
            const std::string prefix = randomBytes(rng, 2);
            want.clear();
            for (auto it = model.lower_bound(prefix);
                 it != model.end() && it->first.compare(0, prefix.size(), prefix) == 0; ++it)
                want.push_back(*it);
            got.clear();
            for (const auto& e : table.with_prefix(prefix))
                got.emplace_back(std::string(e.key()), std::string(e.data()));
            ASSERT_EQ(got, want) << "with_prefix";
        }
    }
    EXPECT_FALSE(kovpager::failed());
}

TEST_F(Face, IntTableMatchesAMap) {
    kovpager::IntTable table;
    std::map<std::int64_t, std::string> model;
    std::mt19937_64 rng(5);
    for (int step = 0; step < 3000; ++step) {
        const std::int64_t key = static_cast<std::int64_t>(rng() % 2000) - 1000;
        if (rng() % 3 != 0) {
            const std::string data = std::to_string(rng() % 100000);
            table.put(key, data);
            model[key] = data;
        } else {
            const std::optional<std::string> got = table.get(key);
            const auto it = model.find(key);
            ASSERT_EQ(got.has_value(), it != model.end());
            if (got.has_value()) {
                ASSERT_EQ(*got, it->second);
            }
        }
    }
    std::vector<std::pair<std::int64_t, std::string>> rows;
    for (const auto& e : table)
        rows.emplace_back(e.key(), std::string(e.data()));
    EXPECT_EQ(rows, (std::vector<std::pair<std::int64_t, std::string>>(model.begin(), model.end())));
    for (std::int64_t from : {std::int64_t{-2000}, std::int64_t{-7}, std::int64_t{0},
                              std::int64_t{999}, std::int64_t{5000}}) {
        rows.clear();
        for (const auto& e : table.lower_bound(from))
            rows.emplace_back(e.key(), std::string(e.data()));
        EXPECT_EQ(rows, (std::vector<std::pair<std::int64_t, std::string>>(model.lower_bound(from),
                                                                           model.end())))
            << from;
    }
}

TEST_F(Face, IndexTableMatchesASet) {
    kovpager::IndexTable table;
    std::map<std::string, std::string> model;
    std::mt19937 rng(9);
    for (int step = 0; step < 2000; ++step) {
        const std::string key = randomBytes(rng, 7);
        if (rng() % 2 == 0) {
            table.put(key);
            model[key];
        } else {
            ASSERT_EQ(table.contains(key), model.count(key) != 0);
        }
    }
    EXPECT_EQ(walkAll(table),
              (std::vector<std::pair<std::string, std::string>>(model.begin(), model.end())));
    std::size_t n = 0;
    for (const auto& e : table.with_prefix("ab")) {
        EXPECT_EQ(e.key().substr(0, 2), "ab");
        EXPECT_TRUE(e.data().empty());
        ++n;
    }
    std::size_t want = 0;
    for (const auto& kv : model)
        want += kv.first.compare(0, 2, "ab") == 0 ? 1 : 0;
    EXPECT_EQ(n, want);
}

// An empty table walks nothing; a walk of a table that another table's creation interrupts goes
// on where it was; two walks of one table are independent.
TEST_F(Face, WalksAreIndependentAndSurviveTableCreation) {
    kovpager::BytesTable empty;
    EXPECT_TRUE(walkAll(empty).empty());
    EXPECT_TRUE(walkAll(empty).empty());
    kovpager::IntTable table;
    for (std::int64_t k = 0; k < 100; ++k)
        table.put(k, "v" + std::to_string(k));
    std::int64_t expected = 0;
    auto outer = table.begin();
    for (; outer != table.end(); ++outer) {
        ASSERT_EQ((*outer).key(), expected);
        if (expected == 50) {
            kovpager::IndexTable made;  // closes and reopens every cursor
            made.put("x");
            std::int64_t inner = 0;
            for (const auto& e : table)
                EXPECT_EQ(e.key(), inner++);
            EXPECT_EQ(inner, 100);
        }
        ++expected;
    }
    EXPECT_EQ(expected, 100);
}

// Tables move: the new owner has the entries, the moved-from one is empty.
TEST_F(Face, TablesMove) {
    kovpager::BytesTable a;
    a.put("k", "v");
    kovpager::BytesTable b(std::move(a));
    EXPECT_EQ(b.get("k"), std::optional<std::string>("v"));
    kovpager::BytesTable c;
    c.put("other", "x");
    c = std::move(b);
    EXPECT_EQ(c.get("k"), std::optional<std::string>("v"));
    EXPECT_EQ(c.get("other"), std::nullopt);
    EXPECT_EQ(walkAll(c).size(), 1u);
}

// failed(), failure() and reset() are the pager's.
TEST_F(Face, FailureAndResetForwardToThePager) {
    EXPECT_EQ(kovpager::failed(), KovPager::instance()->failed());
    EXPECT_EQ(kovpager::failure(), KovPager::instance()->failure());
    {
        kovpager::IntTable table;
        table.put(1, "one");
        EXPECT_EQ(table.get(1), std::optional<std::string>("one"));
    }
    kovpager::reset();
    EXPECT_EQ(KovTestAccess::engine(), nullptr);
    EXPECT_FALSE(kovpager::failed());
    EXPECT_EQ(kovpager::failure(), "");
    kovpager::IntTable fresh;  // reopens the store
    EXPECT_NE(KovTestAccess::engine(), nullptr);
    EXPECT_EQ(fresh.get(1), std::nullopt);
}

// A put into a table while one of its walks is alive is misuse: debug builds stop at an assert.
TEST_F(Face, PutDuringAWalkStopsDebugBuilds) {
    EXPECT_DEBUG_DEATH(
        {
            kovpager::IntTable table;
            table.put(1, "one");
            for (const auto& e : table) {
                (void)e;
                table.put(2, "two");
            }
        },
        "put\\(\\) while a walk of the table is alive");
}
