// Cursors: thin pass-throughs to the engine cursor found in the registry on every call, because
// the pager replaces that handle whenever a table is created.
//
// Every out-value is initialised before the engine call, so a refused call (a refused writing
// cursor's null handle, an inert cursor after reset, a wrong key form) reports "no entry": moves
// false, seeks negative, sizes 0.
#include <kovpager/KovBtreeCursor.h>

#include <cstring>

#include "engine/btree.h"

namespace eng = kov::engine;

namespace {

constexpr std::uint32_t kFreeSlot = 0xFFFFFFFFu;

}  // namespace

KovBtreeCursor::KovBtreeCursor(const KovBtree& table, bool write)
    : registry_(nullptr), slotIndex_(0) {
    KovPager* pager = KovPager::instance();
    registry_ = &pager->cursorSlots_;
    slotIndex_ = registry_->size();
    // Built before the append: push_back may move the registry's storage.
    const CursorSlot slot{nullptr, table.rootPage_, table.tableFlags_};
    registry_->push_back(slot);
    eng::sqlite3BtreeCursor(pager->engine_, table.rootPage_, write ? 1 : 0, nullptr, nullptr,
                            &(*registry_)[slotIndex_].cursor);
}

KovBtreeCursor::~KovBtreeCursor() {
    KovPager* pager = KovPager::instance();
    // With the engine closed (reset, or the exit-time teardown) the slot stays as it is.
    if (pager->engine_ == nullptr)
        return;
    std::vector<CursorSlot>& slots = *registry_;
    if (slotIndex_ >= slots.size())
        return;
    CursorSlot& slot = slots[slotIndex_];
    if (slot.cursor != nullptr)
        eng::sqlite3BtreeCloseCursor(slot.cursor);
    slot.cursor = nullptr;
    slot.rootPage = kFreeSlot;
    while (!slots.empty() && slots.back().rootPage == kFreeSlot)
        slots.pop_back();
}

eng::BtCursor* KovBtreeCursor::handle() const {
    // The registry is emptied by the pager's teardown; a cursor that outlives it has no handle.
    return slotIndex_ < registry_->size() ? (*registry_)[slotIndex_].cursor : nullptr;
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

// Composite keys live on byte-string tables; on an integer-keyed table the "key length" the
// engine reports is the integer key itself, so no fetch is attempted there.
bool KovBtreeCursor::indexKeyFetch(const void* prefix, std::uint64_t prefixSize, void* payload,
                                   std::uint64_t payloadSize) {
    if (onIntegerTable())
        return false;
    const std::int64_t keyLength = keySize();
    if (static_cast<std::uint64_t>(keyLength) != prefixSize + payloadSize)
        return false;
    return fetchPayload(prefix, prefixSize, payload, payloadSize);
}

bool KovBtreeCursor::indexKeyFetch(const void* prefix, std::uint64_t prefixSize,
                                   std::string& payload) {
    if (onIntegerTable())
        return false;
    const std::int64_t keyLength = keySize();
    // A key shorter than the prefix cannot begin with it (this covers a cursor on no entry).
    if (keyLength < 0 || static_cast<std::uint64_t>(keyLength) < prefixSize)
        return false;
    payload.resize(static_cast<std::size_t>(static_cast<std::uint64_t>(keyLength) - prefixSize));
    return fetchPayload(prefix, prefixSize, payload.data(), payload.size());
}

// The current key is known to be prefixSize + payloadSize bytes long. The engine lends it in
// place: the prefix is compared there and, on a match, the payload copied out of it, so no key is
// copied that the caller did not ask for. A mismatch leaves the payload buffer untouched. With no
// entry (or no engine cursor) the key reads as empty.
bool KovBtreeCursor::fetchPayload(const void* prefix, std::uint64_t prefixSize, void* payload,
                                  std::uint64_t payloadSize) {
    std::uint32_t available = 0;
    const auto* key =
        static_cast<const unsigned char*>(eng::sqlite3BtreeKeyFetch(handle(), &available));
    if (available != prefixSize + payloadSize)
        return false;
    if (prefixSize > 0 && std::memcmp(key, prefix, static_cast<std::size_t>(prefixSize)) != 0)
        return false;
    if (payloadSize > 0)
        std::memcpy(payload, key + prefixSize, static_cast<std::size_t>(payloadSize));
    return true;
}

bool KovBtreeCursor::onIntegerTable() const {
    return slotIndex_ < registry_->size() &&
           ((*registry_)[slotIndex_].tableFlags & eng::BTREE_INTKEY) != 0;
}
