// The store as a host uses it: one table of the workload's kind and one
// writing cursor on it for the whole run (the cursor is destroyed before the
// table, as the store requires). The counting workload keeps 8-byte counts
// in a BlobTable (bench/store_ops.h).
#ifndef KOVPAGER_BENCH_PEERS_STORE_H
#define KOVPAGER_BENCH_PEERS_STORE_H

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "bench/bench_util.h"
#include "bench/store_ops.h"

namespace kov::peers {

class StoreBackend {
  public:
    static constexpr const char* kName = "store";

    explicit StoreBackend(const std::string& /*scratch: KOV_TEMP names it*/) {}
    ~StoreBackend() {
        cursor_.reset();
        table_.reset();
    }
    StoreBackend(const StoreBackend&) = delete;
    StoreBackend& operator=(const StoreBackend&) = delete;

    void beginInt() { open(KovBtree::IntKeyTable); }
    void beginBlob() { open(KovBtree::BlobTable); }
    void beginKeys() { open(KovBtree::IndexTable); }
    void beginCounts() { open(KovBtree::BlobTable); }

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        cursor_->insert(key, data, size);
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        cursor_->insert(key, keySize, data, dataSize);
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) { cursor_->insert(key, keySize); }
    void increment(const unsigned char* key, std::size_t keySize) {
        kov::bench::storeIncrement(*cursor_, key, keySize);
    }

    bool readable(std::int64_t key) { return kov::bench::storeReadable(*cursor_, key); }
    bool readable(const unsigned char* key, std::size_t keySize) {
        return kov::bench::storeReadable(*cursor_, key, keySize);
    }

    // Every entry in key order, key and data copied out and handed to
    // visit(key, keySize, data, dataSize).
    template <class Visit>
    void scan(Visit&& visit) {
        KovBtreeCursor& c = *cursor_;
        for (bool on = c.first(); on; on = c.next()) {
            c.indexKeyFetch("", 0, key_);  // the empty prefix: the whole key
            std::int64_t size = c.dataSize();
            data_.resize(static_cast<std::size_t>(size));
            c.data(data_.data(), static_cast<std::uint64_t>(size));
            visit(reinterpret_cast<const unsigned char*>(key_.data()), key_.size(), data_.data(),
                  data_.size());
        }
    }

    // A point seek with the data read; false when the key is missing.
    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        KovBtreeCursor& c = *cursor_;
        if (c.seek(key, keySize) != 0) {
            return false;
        }
        std::int64_t size = c.dataSize();
        data_.resize(static_cast<std::size_t>(size));
        c.data(data_.data(), static_cast<std::uint64_t>(size));
        tally.add(key, keySize, data_.data());
        return true;
    }

    // Every entry whose key begins with the prefix; returns how many.
    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        KovBtreeCursor& c = *cursor_;
        std::size_t walked = 0;
        for (bool on = c.indexKeySeek(prefix, prefixSize);
             on && c.indexKeyFetch(prefix, prefixSize, key_); on = c.next()) {
            tally.add(prefix, key_.size(), reinterpret_cast<const unsigned char*>(key_.data()));
            ++walked;
        }
        return walked;
    }

  private:
    void open(KovBtree::TableType type) {
        cursor_.reset();
        table_ = std::make_unique<KovBtree>(type);
        cursor_ = std::make_unique<KovBtreeCursor>(*table_, true);
    }

    std::unique_ptr<KovBtree> table_;
    std::unique_ptr<KovBtreeCursor> cursor_;
    std::string key_;
    std::vector<unsigned char> data_;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_STORE_H
