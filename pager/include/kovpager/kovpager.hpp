// kovpager.hpp: the store through C++17 types. Header-only, over the three classes of
// <kovpager/KovPager.h>, <kovpager/KovBtree.h> and <kovpager/KovBtreeCursor.h>, which stay as
// they are; everything here is inline in namespace kovpager.
//
//   kovpager::BytesTable users;                          // a new, empty table
//   users.put("alice", "admin");                         // inserts, or replaces
//   std::optional<std::string> role = users.get("alice");
//   std::optional<std::string_view> in_place = users.get_view("alice");  // no copy
//   for (const auto& e : users)                          // key order
//       std::cout << e.key() << " = " << e.data() << "\n";
//   for (const auto& e : users.with_prefix("al")) ...    // keys beginning with "al"
//   for (const auto& e : users.lower_bound("b")) ...     // from the first key not less than "b"
//   if (kovpager::failed()) std::cerr << kovpager::failure() << "\n";
//
// Tables. IntTable has signed 64-bit keys with data, BytesTable byte-string keys with data,
// IndexTable byte-string keys alone. Byte-string keys order bytewise unsigned, the shorter first
// when one is a prefix of the other; integer keys as signed numbers. A table object owns its
// table: default construction makes a new, empty one, destruction drops it. Tables move (the
// moved-from object owns nothing and may only be destroyed or assigned to) and do not copy.
//
// Walks. A table is a range: range-for walks it in key order. lower_bound(key) and, for byte
// keys, with_prefix(prefix) are ranges too. Each element gives key() (std::int64_t, or a
// std::string_view of the key's bytes) and data() (a std::string_view; empty on IndexTable).
// Views point into the store's memory: they are valid until the walk advances or ends, until
// any put() into that table, the construction of any table, or reset(). Copy what must live
// longer (std::string(e.data())). get_view(key) hands out the data of one key the same way,
// valid until the next put(), get() or get_view() on that table, the construction of any
// table, or reset().
//
// Misuse, and what happens:
//   - put() into a table while one of its walks is alive: the walk's position is lost (it may
//     end early or skip entries). Debug builds stop at an assert.
//   - a walk, or a view, kept past its table: the walk goes on reading the table, whose pages
//     stay in the store until reset(); a view is valid only as said above. Debug builds stop at
//     an assert when a table is destroyed while one of its walks is alive.
//   - anything but destruction or assignment on a moved-from table: debug builds stop at an
//     assert; release builds do nothing and report absent keys and empty walks.
//   - use after reset(): every table and walk made before it is void, as for the classes
//     underneath (KovPager.h).
//
// Failures (a full disk, an I/O error of the temporary file, ...) do not throw: failed() turns
// true and failure() says what happened, until reset() (KovPager.h). Allocation failures throw
// std::bad_alloc, as the standard containers do.
//
// Thread safety: none; one thread at a time, like the whole store.
#ifndef KOVPAGER_KOVPAGER_HPP
#define KOVPAGER_KOVPAGER_HPP

#include <cassert>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>

namespace kovpager {

// True once the store has lost or refused data through a failure, until reset().
inline bool failed() { return KovPager::instance()->failed(); }
// That first failure as one sentence for a log; empty while failed() is false.
inline std::string failure() { return KovPager::instance()->failure(); }
// Closes the store: every table and walk made before is void; the next table opens a fresh,
// empty store.
inline void reset() { KovPager::instance()->reset(); }

namespace detail {

// How an integer-keyed and a byte-keyed walk read and seek. Stored: a start key the walk keeps.
struct IntKeys {
    using Key = std::int64_t;
    using Stored = std::int64_t;
    static Key key(KovBtreeCursor& c) {
        std::int64_t k = 0;
        c.key(k);
        return k;
    }
    // To the first entry whose key is not less than `key`.
    static bool lowerBound(KovBtreeCursor& c, Key key) {
        const std::int32_t cmp = c.seek(key);
        if (cmp >= 0)
            return c.good();
        return c.good() && c.next();  // on the largest smaller one: step past it
    }
};

struct ByteKeys {
    using Key = std::string_view;
    using Stored = std::string;
    static Key key(KovBtreeCursor& c) { return c.keyView(); }
    static bool lowerBound(KovBtreeCursor& c, Key key) {
        return c.indexKeySeek(key.data(), key.size());
    }
};

// One entry of a walk: views valid until the walk advances.
template <typename Keys>
class Entry {
  public:
    explicit Entry(KovBtreeCursor* c) : cursor_(c) {}
    typename Keys::Key key() const { return Keys::key(*cursor_); }
    std::string_view data() const { return cursor_->dataView(); }

  private:
    KovBtreeCursor* cursor_;
};

struct WalkEnd {};

// A walk's position: owns its cursor (move-only) and counts itself among its table's live
// walks; equal to WalkEnd once past the last entry of its range.
template <typename Keys>
class WalkIterator {
  public:
    WalkIterator(std::unique_ptr<KovBtreeCursor> cursor, std::shared_ptr<std::size_t> walks,
                 bool on, std::string prefix)
        : cursor_(std::move(cursor)), walks_(std::move(walks)), prefix_(std::move(prefix)) {
        if (walks_ != nullptr)
            ++*walks_;
        on_ = on && inRange();
    }
    WalkIterator(WalkIterator&& other) noexcept
        : cursor_(std::move(other.cursor_)),
          walks_(std::move(other.walks_)),
          prefix_(std::move(other.prefix_)),
          on_(std::exchange(other.on_, false)) {}
    WalkIterator& operator=(WalkIterator&& other) noexcept {
        if (this != &other) {
            release();
            cursor_ = std::move(other.cursor_);
            walks_ = std::move(other.walks_);
            prefix_ = std::move(other.prefix_);
            on_ = std::exchange(other.on_, false);
        }
        return *this;
    }
    WalkIterator(const WalkIterator&) = delete;
    WalkIterator& operator=(const WalkIterator&) = delete;
    ~WalkIterator() { release(); }

    Entry<Keys> operator*() const { return Entry<Keys>(cursor_.get()); }
    WalkIterator& operator++() {
        on_ = on_ && cursor_->next() && inRange();
        return *this;
    }
    friend bool operator!=(const WalkIterator& it, WalkEnd) { return it.on_; }
    friend bool operator==(const WalkIterator& it, WalkEnd) { return !it.on_; }

  private:
    bool inRange() const {
        return prefix_.empty() || cursor_->keyView().substr(0, prefix_.size()) == prefix_;
    }
    void release() {
        if (walks_ != nullptr)
            --*walks_;
        walks_.reset();
        cursor_.reset();
    }

    std::unique_ptr<KovBtreeCursor> cursor_;
    std::shared_ptr<std::size_t> walks_;
    std::string prefix_;  // a walk of keys beginning with it; empty for no limit
    bool on_ = false;
};

// A range: begin() starts the walk (once), from the first entry or from the first whose key is
// not less than `from`; end() is where it stops.
template <typename Keys>
class Walk {
  public:
    Walk(std::unique_ptr<KovBtreeCursor> cursor, std::shared_ptr<std::size_t> walks,
         std::optional<typename Keys::Stored> from, std::string prefix)
        : cursor_(std::move(cursor)),
          walks_(std::move(walks)),
          from_(std::move(from)),
          prefix_(std::move(prefix)) {}

    WalkIterator<Keys> begin() {
        std::unique_ptr<KovBtreeCursor> c = std::move(cursor_);
        bool on = false;
        if (c != nullptr)
            on = from_.has_value() ? Keys::lowerBound(*c, *from_) : c->first();
        return WalkIterator<Keys>(std::move(c), walks_, on, prefix_);
    }
    WalkEnd end() const { return {}; }

  private:
    std::unique_ptr<KovBtreeCursor> cursor_;
    std::shared_ptr<std::size_t> walks_;
    std::optional<typename Keys::Stored> from_;
    std::string prefix_;
};

// What the three tables share: the table, a writing cursor for put(), get(), get_view() and
// contains(), the count of live walks (for the debug checks above), and the walks themselves.
template <typename Keys>
class TableBase {
  public:
    using Walk = detail::Walk<Keys>;

    TableBase(TableBase&&) noexcept = default;
    TableBase& operator=(TableBase&& other) noexcept {
        if (this != &other) {
            assertNoWalks();
            cursor_.reset();  // before its table
            table_.reset();
            walks_ = std::move(other.walks_);
            table_ = std::move(other.table_);
            cursor_ = std::move(other.cursor_);
        }
        return *this;
    }
    TableBase(const TableBase&) = delete;
    TableBase& operator=(const TableBase&) = delete;
    ~TableBase() {
        assertNoWalks();
        cursor_.reset();  // before its table
    }

    // Every entry, in key order.
    WalkIterator<Keys> begin() const { return walk(std::nullopt, std::string()).begin(); }
    WalkEnd end() const { return {}; }
    // The entries from the first whose key is not less than `key`.
    Walk lower_bound(typename Keys::Key key) const {
        return walk(typename Keys::Stored(key), std::string());
    }

  protected:
    explicit TableBase(KovBtree::TableType type)
        : walks_(std::make_shared<std::size_t>(0)),
          table_(std::make_unique<KovBtree>(type)),
          cursor_(std::make_unique<KovBtreeCursor>(*table_, true)) {}

    // The writing cursor; null for a moved-from table.
    KovBtreeCursor* writer() {
        assert(cursor_ != nullptr && "a moved-from table");
        return cursor_.get();
    }
    static std::optional<std::string> copied(std::optional<std::string_view> data) {
        if (!data.has_value())
            return std::nullopt;
        return std::string(*data);
    }
    void beforePut() const {
        assert(walks_ == nullptr || *walks_ == 0 || !"put() while a walk of the table is alive");
    }
    // A walk on a cursor of its own (none for a moved-from table).
    Walk walk(std::optional<typename Keys::Stored> from, std::string prefix) const {
        assert(table_ != nullptr && "a moved-from table");
        std::unique_ptr<KovBtreeCursor> c;
        if (table_ != nullptr)
            c = std::make_unique<KovBtreeCursor>(*table_, true);
        return Walk(std::move(c), walks_, std::move(from), std::move(prefix));
    }

  private:
    void assertNoWalks() const {
        assert(walks_ == nullptr || *walks_ == 0 ||
               !"a table destroyed while one of its walks is alive");
    }

    std::shared_ptr<std::size_t> walks_;
    std::unique_ptr<KovBtree> table_;
    std::unique_ptr<KovBtreeCursor> cursor_;
};

// Byte-string keys: BytesTable and IndexTable.
class ByteKeyTable : public TableBase<ByteKeys> {
  public:
    // The entries whose key begins with `prefix`, in key order.
    Walk with_prefix(std::string_view prefix) const {
        return walk(std::string(prefix), std::string(prefix));
    }

  protected:
    explicit ByteKeyTable(KovBtree::TableType type) : TableBase(type) {}

    // The writing cursor on the entry with this key, or null.
    KovBtreeCursor* find(std::string_view key) {
        KovBtreeCursor* c = writer();
        if (c == nullptr || c->seek(key.data(), key.size()) != 0)
            return nullptr;
        return c;
    }
};

}  // namespace detail

// Signed 64-bit keys with data.
class IntTable : public detail::TableBase<detail::IntKeys> {
  public:
    IntTable() : TableBase(KovBtree::IntKeyTable) {}

    // Inserts the entry, or replaces the one with the same key.
    void put(std::int64_t key, std::string_view data) {
        beforePut();
        if (KovBtreeCursor* c = writer())
            c->insert(key, data.data(), data.size());
    }
    // The data of `key`, or nothing when there is no such entry.
    std::optional<std::string> get(std::int64_t key) { return copied(get_view(key)); }
    // The same without a copy: a view of the data where it lies, valid until the next put(),
    // get() or get_view() on this table, the construction of any table, or reset().
    std::optional<std::string_view> get_view(std::int64_t key) {
        KovBtreeCursor* c = writer();
        if (c == nullptr || c->seek(key) != 0)
            return std::nullopt;
        return c->dataView();
    }
};

// Byte-string keys with data.
class BytesTable : public detail::ByteKeyTable {
  public:
    BytesTable() : ByteKeyTable(KovBtree::BlobTable) {}

    // Inserts the entry, or replaces the one with the same key.
    void put(std::string_view key, std::string_view data) {
        beforePut();
        if (KovBtreeCursor* c = writer())
            c->insert(key.data(), key.size(), data.data(), data.size());
    }
    // The data of `key`, or nothing when there is no such entry.
    std::optional<std::string> get(std::string_view key) { return copied(get_view(key)); }
    // The same without a copy: a view of the data where it lies, valid until the next put(),
    // get() or get_view() on this table, the construction of any table, or reset().
    std::optional<std::string_view> get_view(std::string_view key) {
        KovBtreeCursor* c = find(key);
        if (c == nullptr)
            return std::nullopt;
        return c->dataView();
    }
};

// Byte-string keys alone.
class IndexTable : public detail::ByteKeyTable {
  public:
    IndexTable() : ByteKeyTable(KovBtree::IndexTable) {}

    // Inserts the key (an equal key is already there: nothing changes).
    void put(std::string_view key) {
        beforePut();
        if (KovBtreeCursor* c = writer())
            c->insert(key.data(), key.size());
    }
    // Whether the key is in the table.
    bool contains(std::string_view key) { return find(key) != nullptr; }
};

}  // namespace kovpager

#endif  // KOVPAGER_KOVPAGER_HPP
