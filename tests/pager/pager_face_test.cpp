// The C++17 face (<kovpager/kovpager.hpp>): put, get, get_view and contains, range-for walks,
// lower_bound and with_prefix on the three tables, checked against std::map models with random
// operations; views compared byte for byte; moves; failed(), failure() and reset() forwarded.
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
            const auto it = model.find(key);
            const std::optional<std::string_view> view = table.get_view(key);
            ASSERT_EQ(view.has_value(), it != model.end()) << step;
            if (view.has_value()) {
                ASSERT_EQ(*view, it->second) << step;
            }
            const std::optional<std::string> got = table.get(key);
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
            const auto it = model.find(key);
            const std::optional<std::string_view> view = table.get_view(key);
            ASSERT_EQ(view.has_value(), it != model.end());
            if (view.has_value()) {
                ASSERT_EQ(*view, it->second);
            }
            const std::optional<std::string> got = table.get(key);
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

// get_view hands out the data where it lies: the view of a key that is on its page points into
// the same bytes as a walk's data() of that entry, it stays put while walks of the table and
// reads of other tables go on, and data on overflow pages is whole. Absent keys give nothing.
TEST_F(Face, GetViewReadsTheDataInPlace) {
    kovpager::BytesTable table;
    kovpager::IntTable other;
    const std::string big(9000, 'b');
    table.put("a", "alpha");
    table.put("big", big);
    table.put("c", "gamma");
    other.put(7, "seven");
    EXPECT_EQ(table.get_view("zz"), std::nullopt);
    EXPECT_EQ(other.get_view(8), std::nullopt);

    const std::optional<std::string_view> alpha = table.get_view("a");
    ASSERT_TRUE(alpha.has_value());
    EXPECT_EQ(*alpha, "alpha");
    const char* const where = alpha->data();
    auto walk = table.begin();
    ASSERT_TRUE(walk != table.end());
    EXPECT_EQ((*walk).data().data(), where);  // the same bytes: no copy on either side
    for (const auto& e : table)
        EXPECT_FALSE(e.key().empty());
    EXPECT_EQ(other.get_view(7), std::optional<std::string_view>("seven"));
    EXPECT_EQ(alpha->data(), where);
    EXPECT_EQ(*alpha, "alpha");  // still valid: no put, get or get_view on its table since

    EXPECT_EQ(table.get_view("big"), std::optional<std::string_view>(big));
    EXPECT_EQ(table.get_view("c"), std::optional<std::string_view>("gamma"));
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

namespace {

// One table of a random program, with its model.
struct ModelledTable {
    int kind = 0;  // 0 integer keys, 1 byte keys with data, 2 byte keys alone
    std::unique_ptr<kovpager::IntTable> ints;
    std::unique_ptr<kovpager::BytesTable> bytes;
    std::unique_ptr<kovpager::IndexTable> keys;
    std::map<std::int64_t, std::string> intModel;
    std::map<std::string, std::string> byteModel;

    explicit ModelledTable(int k) : kind(k) {
        if (kind == 0)
            ints = std::make_unique<kovpager::IntTable>();
        else if (kind == 1)
            bytes = std::make_unique<kovpager::BytesTable>();
        else
            keys = std::make_unique<kovpager::IndexTable>();
    }
};

}  // namespace

// Random programs over several tables of the three kinds at once: tables made and destroyed
// (cursors of the others closed and reopened each time), puts, gets and contains, whole walks,
// lower_bound walks and prefix walks, resets; every answer checked against the models.
TEST_F(Face, RandomProgramsOverSeveralTablesMatchTheModels) {
    for (std::uint32_t seed = 1; seed <= 40; ++seed) {
        SCOPED_TRACE("seed " + std::to_string(seed));
        std::mt19937 rng(seed);
        std::vector<std::unique_ptr<ModelledTable>> tables;
        for (int step = 0; step < 400; ++step) {
            const unsigned op = rng() % 100;
            if (tables.empty() || (op < 6 && tables.size() < 4)) {
                tables.push_back(std::make_unique<ModelledTable>(static_cast<int>(rng() % 3)));
                continue;
            }
            ModelledTable& t = *tables[rng() % tables.size()];
            if (op < 9) {
                tables.erase(tables.begin() + static_cast<std::ptrdiff_t>(rng() % tables.size()));
            } else if (op < 10) {
                tables.clear();  // a host lets its tables go, then starts over
                kovpager::reset();
            } else if (op < 60) {
                if (t.kind == 0) {
                    const std::int64_t k = static_cast<std::int64_t>(rng() % 300) - 150;
                    const std::string d = randomBytes(rng, 12);
                    t.ints->put(k, d);
                    t.intModel[k] = d;
                } else {
                    const std::string k = randomBytes(rng, 5);
                    const std::string d = t.kind == 1 ? randomBytes(rng, 12) : std::string();
                    if (t.kind == 1)
                        t.bytes->put(k, d);
                    else
                        t.keys->put(k);
                    t.byteModel[k] = d;
                }
            } else if (op < 80) {
                if (t.kind == 0) {
                    const std::int64_t k = static_cast<std::int64_t>(rng() % 300) - 150;
                    const auto it = t.intModel.find(k);
                    ASSERT_EQ(t.ints->get_view(k), it == t.intModel.end()
                                                       ? std::nullopt
                                                       : std::optional<std::string_view>(it->second));
                } else {
                    const std::string k = randomBytes(rng, 5);
                    const auto it = t.byteModel.find(k);
                    if (t.kind == 1) {
                        ASSERT_EQ(t.bytes->get(k), it == t.byteModel.end()
                                                       ? std::nullopt
                                                       : std::optional<std::string>(it->second));
                    } else {
                        ASSERT_EQ(t.keys->contains(k), it != t.byteModel.end());
                    }
                }
            } else if (op < 90) {
                if (t.kind == 0) {
                    std::vector<std::pair<std::int64_t, std::string>> got;
                    for (const auto& e : *t.ints)
                        got.emplace_back(e.key(), std::string(e.data()));
                    ASSERT_EQ(got, (std::vector<std::pair<std::int64_t, std::string>>(
                                       t.intModel.begin(), t.intModel.end())));
                } else {
                    ASSERT_EQ(t.kind == 1 ? walkAll(*t.bytes) : walkAll(*t.keys),
                              (std::vector<std::pair<std::string, std::string>>(
                                  t.byteModel.begin(), t.byteModel.end())));
                }
            } else if (t.kind == 0) {
                // The first few entries from a key on.
                const std::int64_t from = static_cast<std::int64_t>(rng() % 320) - 160;
                auto want = t.intModel.lower_bound(from);
                int n = 0;
                for (const auto& e : t.ints->lower_bound(from)) {
                    ASSERT_NE(want, t.intModel.end());
                    ASSERT_EQ(e.key(), want->first);
                    ASSERT_EQ(e.data(), want->second);
                    ++want;
                    if (++n == 5)
                        break;
                }
                if (n < 5) {
                    ASSERT_EQ(want, t.intModel.end());
                }
            } else {
                const std::string prefix = randomBytes(rng, 2);
                auto want = t.byteModel.lower_bound(prefix);
                auto walk = t.kind == 1 ? t.bytes->with_prefix(prefix) : t.keys->with_prefix(prefix);
                for (const auto& e : walk) {
                    ASSERT_NE(want, t.byteModel.end());
                    ASSERT_EQ(std::string(e.key()), want->first);
                    ASSERT_EQ(std::string(e.data()), want->second);
                    ++want;
                }
                ASSERT_TRUE(want == t.byteModel.end() ||
                            want->first.compare(0, prefix.size(), prefix) != 0);
            }
        }
        ASSERT_FALSE(kovpager::failed()) << kovpager::failure();
        tables.clear();
        kovpager::reset();
    }
}
