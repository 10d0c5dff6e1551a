// Loads sorted in runs: the buffer, run writing and the merge (see sorted_load.h).
#include "engine/sorted_load.h"

#include <algorithm>
#include <cstring>
#include <queue>
#include <string>

// engine/btree.h before SQLite's header: its result codes share SQLite's macro names.
#include "engine/btree.h"
#include "engine/private_sqlite3.h"

namespace kov::engine {

namespace {

// A record in the buffer: the integer key, the key's and the data's sizes, then the key bytes and
// the data bytes. Records start on 8-byte boundaries.
struct RecordHeader {
    std::int64_t intKey;
    std::uint32_t keySize;
    std::uint32_t dataSize;
};

constexpr std::size_t kAlign = 8;
constexpr std::size_t kBlockSize = std::size_t{256} << 10;

std::size_t recordSize(std::uint32_t keySize, std::uint32_t dataSize) {
    std::size_t size = sizeof(RecordHeader) + keySize + dataSize;
    return (size + kAlign - 1) & ~(kAlign - 1);
}

// The first 8 key bytes as a big-endian number (zeros past the key's end): two keys whose orders
// differ sort as their orders do.
std::uint64_t orderOf(const unsigned char* key, std::uint32_t size) {
    std::uint64_t order = 0;
    for (std::uint32_t i = 0; i < 8; ++i)
        order = (order << 8) | (i < size ? key[i] : 0u);
    return order;
}

// An SQLite cursor closed when it goes out of scope.
struct OwnedCursor {
    KovsqCursor* cursor = nullptr;
    OwnedCursor() = default;
    OwnedCursor(const OwnedCursor&) = delete;
    OwnedCursor& operator=(const OwnedCursor&) = delete;
    OwnedCursor(OwnedCursor&& other) noexcept : cursor(other.cursor) { other.cursor = nullptr; }
    ~OwnedCursor() { kovsq_cursor_close(cursor); }
};

// The entry an SQLite cursor stands on, lent from its page, or copied into `copy` when part of it
// lies on overflow pages.
int entryAt(KovsqCursor* cursor, const TableShape& shape, std::string& copy, LoadEntry* out) {
    KovsqEntry e{};
    int rc = kovsq_entry(cursor, &e);
    if (rc != SQLITE_OK)
        return rc;
    const unsigned char* payload = e.local;
    const std::uint64_t total = std::uint64_t{e.keyOffset} + e.keySize + e.dataSize;
    if (total > e.localSize) {
        copy.resize(static_cast<std::size_t>(total));
        rc = kovsq_read(cursor, 0, static_cast<std::uint32_t>(total), copy.data());
        if (rc != SQLITE_OK)
            return rc;
        payload = reinterpret_cast<const unsigned char*>(copy.data());
    }
    out->intKey = e.intKey;
    out->key = shape.intKey ? nullptr : payload + e.keyOffset;
    out->keySize = e.keySize;
    out->data = payload + e.keyOffset + e.keySize;
    out->dataSize = e.dataSize;
    return SQLITE_OK;
}

// Whether every key from `smallest` on is larger than the last key of the table that `out`
// stands in: merging is then appending. Leaves `out` on the table's last entry.
int appendsAfterLast(KovsqCursor* out, const TableShape& shape, const LoadEntry& smallest,
                     bool* appends) {
    int empty = 1;
    int rc = kovsq_last(out, &empty);
    if (rc != SQLITE_OK)
        return rc;
    *appends = empty != 0;
    if (!*appends) {
        std::string copy;
        LoadEntry last{};
        rc = entryAt(out, shape, copy, &last);
        if (rc != SQLITE_OK)
            return rc;
        *appends = compareKeys(shape, smallest, last) > 0;
    }
    return SQLITE_OK;
}

// One input of a merge: a run, read through a cursor of its own, or the buffer.
struct Source {
    OwnedCursor run;  // null for the buffer
    const LoadBuffer* buffer = nullptr;
    std::size_t next = 0;  // the buffer's next entry
    std::string copy;      // the current run entry, when it does not lie whole on its page
    LoadEntry current{};
    bool valid = false;

    // Moves to the source's next entry (its first, the first time).
    int advance(const TableShape& shape, bool first) {
        if (buffer != nullptr) {
            valid = next < buffer->size();
            if (valid)
                current = buffer->at(next++);
            return SQLITE_OK;
        }
        int rc;
        if (first) {
            int empty = 1;
            rc = kovsq_first(run.cursor, &empty);
        } else {
            rc = kovsq_next(run.cursor);
        }
        valid = false;
        if (rc == SQLITE_DONE)
            return SQLITE_OK;
        if (rc != SQLITE_OK)
            return rc;
        if (!kovsq_valid(run.cursor))
            return SQLITE_OK;
        valid = true;
        return entryAt(run.cursor, shape, copy, &current);
    }
};

}  // namespace

int insertEntry(KovsqCursor* cursor, const TableShape& shape, const LoadEntry& e, int at) {
    // Empty keys and data are handed on as zero bytes at a real address: SQLite copies them with
    // memcpy, which must not be given a null pointer.
    static const unsigned char kNothing = 0;
    const unsigned char* data = e.data != nullptr ? e.data : &kNothing;
    if (shape.intKey)
        return kovsq_insert_int(cursor, e.intKey, data, e.dataSize, at);
    const unsigned char* key = e.key != nullptr ? e.key : &kNothing;
    return kovsq_insert_key(cursor, key, e.keySize, data, e.dataSize, shape.withData ? 1 : 0, at);
}

int compareKeys(const TableShape& shape, const LoadEntry& a, const LoadEntry& b) {
    if (shape.intKey)
        return a.intKey < b.intKey ? -1 : (a.intKey > b.intKey ? 1 : 0);
    const std::uint32_t common = std::min(a.keySize, b.keySize);
    int c = common == 0 ? 0 : std::memcmp(a.key, b.key, common);
    if (c != 0)
        return c;
    return a.keySize < b.keySize ? -1 : (a.keySize > b.keySize ? 1 : 0);
}

std::size_t LoadBuffer::footprint(std::uint32_t keySize, std::uint32_t dataSize) {
    return recordSize(keySize, dataSize) + sizeof(Slot);
}

unsigned char* LoadBuffer::allocate(std::size_t size) {
    if (blocks_.empty() || blockUsed_ + size > blockSize_) {
        const std::size_t blockSize = std::max(size, kBlockSize);
        blocks_.push_back(std::make_unique<unsigned char[]>(blockSize));
        blockSize_ = blockSize;
        blockUsed_ = 0;
    }
    unsigned char* p = blocks_.back().get() + blockUsed_;
    blockUsed_ += size;
    return p;
}

void LoadBuffer::add(std::int64_t intKey, const void* key, std::uint32_t keySize, const void* data,
                     std::uint32_t dataSize) {
    if (intKey_)
        keySize = 0;
    if (slots_.size() == slots_.capacity())  // may throw: nothing is changed then
        slots_.reserve(std::max<std::size_t>(1024, slots_.capacity() * 2));
    unsigned char* record = allocate(recordSize(keySize, dataSize));
    const RecordHeader header{intKey, keySize, dataSize};
    std::memcpy(record, &header, sizeof header);
    unsigned char* body = record + sizeof header;
    if (keySize > 0)
        std::memcpy(body, key, keySize);
    if (dataSize > 0)
        std::memcpy(body + keySize, data, dataSize);
    const std::uint64_t order = intKey_ ? static_cast<std::uint64_t>(intKey) ^ (std::uint64_t{1} << 63)
                                        : orderOf(body, keySize);
    slots_.push_back(Slot{order, record, static_cast<std::uint32_t>(slots_.size())});
    bytes_ += footprint(keySize, dataSize);
    // Still strictly increasing: sortUnique has nothing to do.
    const std::size_t n = slots_.size();
    inOrder_ = n == 1 || (inOrder_ && compareSlots(slots_[n - 2], slots_[n - 1]) < 0);
}

LoadEntry LoadBuffer::at(std::size_t i) const {
    const unsigned char* record = slots_[i].record;
    RecordHeader header;
    std::memcpy(&header, record, sizeof header);
    const unsigned char* body = record + sizeof header;
    return LoadEntry{header.intKey, intKey_ ? nullptr : body, header.keySize, body + header.keySize,
                     header.dataSize};
}

int LoadBuffer::compareSlots(const Slot& a, const Slot& b) const {
    if (a.order != b.order)
        return a.order < b.order ? -1 : 1;
    if (intKey_)
        return 0;  // the order is the whole integer key
    RecordHeader ha;
    RecordHeader hb;
    std::memcpy(&ha, a.record, sizeof ha);
    std::memcpy(&hb, b.record, sizeof hb);
    const LoadEntry ea{0, a.record + sizeof ha, ha.keySize, nullptr, 0};
    const LoadEntry eb{0, b.record + sizeof hb, hb.keySize, nullptr, 0};
    return compareKeys(TableShape{false, true}, ea, eb);
}

// Key order, then insertion order among equal keys.
bool LoadBuffer::before(const Slot& a, const Slot& b) const {
    const int c = compareSlots(a, b);
    return c != 0 ? c < 0 : a.sequence < b.sequence;
}

void LoadBuffer::sortUnique() {
    if (inOrder_)
        return;
    inOrder_ = true;
    std::sort(slots_.begin(), slots_.end(),
              [this](const Slot& a, const Slot& b) { return before(a, b); });
    // Of each group of equal keys keep the last, the latest insert.
    std::size_t kept = 0;
    for (std::size_t i = 0; i < slots_.size(); ++i) {
        if (i + 1 < slots_.size() && compareSlots(slots_[i], slots_[i + 1]) == 0)
            continue;
        slots_[kept++] = slots_[i];
    }
    slots_.resize(kept);
}

void LoadBuffer::clear() {
    std::vector<Slot>().swap(slots_);
    blocks_.clear();
    blocks_.shrink_to_fit();
    blockUsed_ = 0;
    blockSize_ = 0;
    bytes_ = 0;
    inOrder_ = true;
}

int writeRun(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
             const LoadBuffer& buffer) {
    OwnedCursor out;
    int rc = kovsq_cursor_open(tree, root, shape.intKey ? 1 : 0, 1, &out.cursor);
    if (rc != SQLITE_OK)
        return rc;
    kovsq_bulk_load(out.cursor, 1);
    for (std::size_t i = 0; i < buffer.size() && rc == SQLITE_OK; ++i)
        rc = insertEntry(out.cursor, shape, buffer.at(i), KOVSQ_AT_END);
    return rc;
}

int appendsToTable(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
                   const LoadBuffer& buffer, bool* appends) {
    *appends = false;
    if (buffer.empty())
        return SQLITE_OK;
    OwnedCursor table;
    int rc = kovsq_cursor_open(tree, root, shape.intKey ? 1 : 0, 0, &table.cursor);
    if (rc != SQLITE_OK)
        return rc;
    return appendsAfterLast(table.cursor, shape, buffer.at(0), appends);
}

int tableIsEmpty(KovsqTree* tree, std::uint32_t root, const TableShape& shape, bool* empty) {
    OwnedCursor table;
    int rc = kovsq_cursor_open(tree, root, shape.intKey ? 1 : 0, 0, &table.cursor);
    int none = 0;
    if (rc == SQLITE_OK)
        rc = kovsq_first(table.cursor, &none);
    *empty = rc == SQLITE_OK && none != 0;
    return rc;
}

int mergeInto(KovsqTree* tree, std::uint32_t root, const TableShape& shape,
              const std::vector<std::uint32_t>& runs, const LoadBuffer& buffer, bool* appended) {
    *appended = false;
    // Sources, oldest first: a larger index is a later insert.
    std::vector<Source> sources(runs.size() + 1);
    int rc = SQLITE_OK;
    for (std::size_t i = 0; i < runs.size() && rc == SQLITE_OK; ++i)
        rc = kovsq_cursor_open(tree, runs[i], shape.intKey ? 1 : 0, 0, &sources[i].run.cursor);
    sources.back().buffer = &buffer;
    for (std::size_t i = 0; i < sources.size() && rc == SQLITE_OK; ++i)
        rc = sources[i].advance(shape, true);
    if (rc != SQLITE_OK)
        return rc;

    // The heap's top is the source with the smallest key, the latest among equal ones.
    auto after = [&](std::size_t a, std::size_t b) {
        int c = compareKeys(shape, sources[a].current, sources[b].current);
        return c != 0 ? c > 0 : a < b;
    };
    std::priority_queue<std::size_t, std::vector<std::size_t>, decltype(after)> heap(after);
    for (std::size_t i = 0; i < sources.size(); ++i) {
        if (sources[i].valid)
            heap.push(i);
    }
    if (heap.empty())
        return SQLITE_OK;

    OwnedCursor out;
    rc = kovsq_cursor_open(tree, root, shape.intKey ? 1 : 0, 1, &out.cursor);
    if (rc != SQLITE_OK)
        return rc;
    // Appending is right when every merged key is larger than the table's last one.
    bool append = false;
    rc = appendsAfterLast(out.cursor, shape, sources[heap.top()].current, &append);
    if (rc != SQLITE_OK)
        return rc;
    kovsq_bulk_load(out.cursor, append ? 1 : 0);
    *appended = append;
    const int at = append ? KOVSQ_AT_END : KOVSQ_SEARCH;

    while (!heap.empty()) {
        const std::size_t top = heap.top();
        heap.pop();
        Source& winner = sources[top];
        rc = insertEntry(out.cursor, shape, winner.current, at);
        // Older entries of the same key are replaced: skip them.
        while (rc == SQLITE_OK && !heap.empty() &&
               compareKeys(shape, sources[heap.top()].current, winner.current) == 0) {
            const std::size_t older = heap.top();
            heap.pop();
            rc = sources[older].advance(shape, false);
            if (rc == SQLITE_OK && sources[older].valid)
                heap.push(older);
        }
        if (rc == SQLITE_OK)
            rc = winner.advance(shape, false);
        if (rc != SQLITE_OK)
            return rc;
        if (winner.valid)
            heap.push(top);
    }
    return SQLITE_OK;
}

}  // namespace kov::engine
