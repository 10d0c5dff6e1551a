// Cursors: thin pass-throughs to the engine cursor found in the registry on every call, because
// the pager replaces that handle whenever a table is created.
//
// Every out-value is initialised before the engine call, so a refused call (a refused writing
// cursor's null handle, an inert cursor after reset, a wrong key form) reports "no entry": moves
// false, seeks negative, sizes 0.
#include <kovpager/KovBtreeCursor.h>

#include <cstring>

#include "engine/btree.h"
#include "pager/CursorRegistry.h"

namespace eng = kov::engine;
using kov::pager::CursorRegistry;
using kov::pager::CursorSlot;

KovBtreeCursor::KovBtreeCursor(const KovBtree& table, bool write)
    : registry_(nullptr), slotIndex_(0) {
    KovPager* pager = KovPager::instance();
    registry_ = &pager->cursorSlots_;
    slotIndex_ = CursorRegistry::add(*pager, table.rootPage_, table.tableFlags_, write);
}

KovBtreeCursor::~KovBtreeCursor() {
    CursorRegistry::release(*KovPager::instance(), slotIndex_);
}

eng::BtCursor* KovBtreeCursor::handle() const {
    // The registry is emptied by the pager's teardown; a cursor that outlives it has no handle.
    const CursorSlot* slot = CursorRegistry::at(*registry_, slotIndex_);
    return slot != nullptr ? slot->cursor : nullptr;
}

bool KovBtreeCursor::first() {
    int empty = 1;
    eng::sqlite3BtreeFirst(handle(), &empty);
    return empty == 0;
}

bool KovBtreeCursor::last() {
    int empty = 1;
    eng::sqlite3BtreeLast(handle(), &empty);
    return empty == 0;
}

bool KovBtreeCursor::next() {
    int none = 1;
    eng::sqlite3BtreeNext(handle(), &none);
    return none == 0;
}

bool KovBtreeCursor::previous() {
    int none = 1;
    eng::sqlite3BtreePrevious(handle(), &none);
    return none == 0;
}

bool KovBtreeCursor::good() {
    return eng::sqlite3BtreeEof(handle()) == 0;
}

std::int32_t KovBtreeCursor::seek(const void* key, std::uint64_t size) {
    int compare = -1;
    eng::sqlite3BtreeMoveto(handle(), key, static_cast<std::int64_t>(size), &compare);
    return compare;
}

std::int32_t KovBtreeCursor::seek(std::int64_t key) {
    int compare = -1;
    eng::sqlite3BtreeMoveto(handle(), nullptr, key, &compare);
    return compare;
}

void KovBtreeCursor::insert(std::int64_t key, const void* data, std::uint64_t size) {
    eng::sqlite3BtreeInsert(handle(), nullptr, key, data, static_cast<int>(size));
}

void KovBtreeCursor::insert(const void* key, std::uint64_t size) {
    eng::sqlite3BtreeInsert(handle(), key, static_cast<std::int64_t>(size), nullptr, 0);
}

void KovBtreeCursor::insert(const void* key, std::uint64_t keySize, const void* data,
                            std::uint64_t dataSize) {
    eng::sqlite3BtreeInsert(handle(), key, static_cast<std::int64_t>(keySize), data,
                            static_cast<int>(dataSize));
}

void KovBtreeCursor::key(std::int64_t& key) {
    std::int64_t size = 0;
    eng::sqlite3BtreeKeySize(handle(), &size);
    key = size;
}

void KovBtreeCursor::key(void* buffer, std::uint64_t size) {
    eng::sqlite3BtreeKey(handle(), 0, static_cast<std::uint32_t>(size), buffer);
}

std::int64_t KovBtreeCursor::keySize() {
    std::int64_t size = 0;
    eng::sqlite3BtreeKeySize(handle(), &size);
    return size;
}

void KovBtreeCursor::data(void* buffer, std::uint64_t size) {
    eng::sqlite3BtreeData(handle(), 0, static_cast<std::uint32_t>(size), buffer);
}

void KovBtreeCursor::dataBuf(void* buffer, std::uint64_t size) {
    data(buffer, size);
}

std::int64_t KovBtreeCursor::dataSize() {
    std::uint32_t size = 0;
    eng::sqlite3BtreeDataSize(handle(), &size);
    return static_cast<std::int64_t>(size);
}

bool KovBtreeCursor::indexKeySeek(const void* key, std::uint64_t size) {
    int compare = -1;
    eng::sqlite3BtreeMoveto(handle(), key, static_cast<std::int64_t>(size), &compare);
    if (compare >= 0)
        return true;
    int none = 1;
    eng::sqlite3BtreeNext(handle(), &none);
    return none == 0;
}

// Composite keys are byte strings. The engine lends the current key in place: the prefix is
// compared there and the payload copied out of it, so no key is copied that the caller did not ask
// for. On no entry (or with no engine cursor) the key reads as empty. A cursor opened on an
// IntKeyTable, or standing on an integer key (a cursor kept over a reset may have been reopened
// on such a table), has no key bytes and fetches nothing.
std::string_view KovBtreeCursor::keyView() {
    // The engine hands out no key bytes on no entry and on an integer-keyed table: both give
    // the empty view, so the table's kind needs no look of its own here.
    std::uint32_t length = 0;
    const void* key = eng::sqlite3BtreeKeyFetch(handle(), &length);
    if (key == nullptr)
        return {};
    return {static_cast<const char*>(key), length};
}

std::string_view KovBtreeCursor::dataView() {
    std::uint32_t length = 0;
    const void* data = eng::sqlite3BtreeDataFetch(handle(), &length);
    if (data == nullptr)
        return {};
    return {static_cast<const char*>(data), length};
}

const unsigned char* KovBtreeCursor::currentKey(std::uint32_t& length) {
    length = 0;
    const CursorSlot* slot = CursorRegistry::at(*registry_, slotIndex_);
    if (slot != nullptr && CursorRegistry::hasIntegerKeys(*slot))
        return nullptr;  // opened on an IntKeyTable
    eng::BtCursor* cursor = handle();
    const void* key = eng::sqlite3BtreeKeyFetch(cursor, &length);
    if (key == nullptr && eng::sqlite3BtreeEof(cursor) == 0)
        return nullptr;  // on an entry whose key is an integer
    static const unsigned char kEmptyKey = 0;
    return key != nullptr ? static_cast<const unsigned char*>(key) : &kEmptyKey;
}

bool KovBtreeCursor::indexKeyFetch(const void* prefix, std::uint64_t prefixSize, void* payload,
                                   std::uint64_t payloadSize) {
    std::uint32_t length = 0;
    const unsigned char* key = currentKey(length);
    if (key == nullptr || length != prefixSize + payloadSize)
        return false;
    return matchAndCopy(key, prefix, prefixSize, payload, payloadSize);
}

bool KovBtreeCursor::indexKeyFetch(const void* prefix, std::uint64_t prefixSize,
                                   std::string& payload) {
    std::uint32_t length = 0;
    const unsigned char* key = currentKey(length);
    // A key shorter than the prefix cannot begin with it (this covers a cursor on no entry).
    if (key == nullptr || length < prefixSize)
        return false;
    payload.resize(static_cast<std::size_t>(length - prefixSize));
    return matchAndCopy(key, prefix, prefixSize, payload.data(), payload.size());
}

// A mismatch leaves the payload buffer untouched.
bool KovBtreeCursor::matchAndCopy(const unsigned char* key, const void* prefix,
                                  std::uint64_t prefixSize, void* payload,
                                  std::uint64_t payloadSize) {
    if (prefixSize > 0 && std::memcmp(key, prefix, static_cast<std::size_t>(prefixSize)) != 0)
        return false;
    if (payloadSize > 0)
        std::memcpy(payload, key + prefixSize, static_cast<std::size_t>(payloadSize));
    return true;
}
