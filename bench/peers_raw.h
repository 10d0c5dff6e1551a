// Hand-written SQLite with the store's settings (bench/raw_sqlite.h: a
// private temporary database, the store's page size and page-cache size, no
// journal, the exclusive lock, one transaction never committed, prepared
// statements, INSERT OR REPLACE; the counting workload's upsert).
#ifndef KOVPAGER_BENCH_PEERS_RAW_H
#define KOVPAGER_BENCH_PEERS_RAW_H

#include <cstdint>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "bench/bench_util.h"
#include "bench/raw_sqlite.h"

namespace kov::peers {

class RawBackend {
  public:
    static constexpr const char* kName = "sqlite";

    explicit RawBackend(const std::string& /*scratch: SQLITE_TMPDIR names it*/)
        : db_(std::make_unique<kov::bench::RawDatabase>()) {}
    ~RawBackend() {
        ints_.reset();
        blobs_.reset();
        keys_.reset();
        counts_.reset();
        db_.reset();
    }
    RawBackend(const RawBackend&) = delete;
    RawBackend& operator=(const RawBackend&) = delete;

    void beginInt() { current_ = begin(ints_); }
    void beginBlob() { current_ = begin(blobs_); }
    void beginKeys() { current_ = begin(keys_); }
    void beginCounts() { current_ = begin(counts_); }

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        ints_->insert(key, data, size);
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        blobs_->insert(key, keySize, data, dataSize);
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) { keys_->insert(key, keySize); }
    void increment(const unsigned char* key, std::size_t keySize) {
        counts_->increment(key, keySize);
    }

    // The table begun last reads back.
    bool readable(std::int64_t key) { return current_->readable(key); }
    bool readable(const unsigned char* key, std::size_t keySize) {
        return current_->readable(key, keySize);
    }

    // The byte-keyed table or, once the counting workload has begun, the
    // count table (each count handed over as its 8 bytes).
    template <class Visit>
    void scan(Visit&& visit) {
        if (counts_ != nullptr) {
            counts_->walk(key_, [&](const unsigned char* key, std::size_t keySize,
                                    std::uint64_t count) {
                visit(key, keySize, reinterpret_cast<const unsigned char*>(&count), sizeof count);
            });
            return;
        }
        for (kov::bench::RawScan& s = blobs_->scan(); s.step();) {
            std::size_t keySize = s.bytes(0);
            key_.resize(keySize);
            std::memcpy(key_.data(), s.blob(0), keySize);
            std::size_t dataSize = s.bytes(1);
            data_.resize(dataSize);
            std::memcpy(data_.data(), s.blob(1), dataSize);
            visit(key_.data(), keySize, data_.data(), dataSize);
        }
    }

    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        data_.resize(kov::bench::kDataSize);
        std::int64_t size = blobs_->seekData(key, keySize, data_.data(), data_.size());
        if (size < 0) {
            return false;
        }
        tally.add(key, keySize, data_.data());
        return true;
    }

    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        return keys_->walkPrefix(prefix, prefixSize,
                                 [&](const unsigned char* payload, std::size_t size) {
                                     key_.resize(size);
                                     std::memcpy(key_.data(), payload, size);
                                     tally.add(prefix, size, key_.data());
                                 });
    }

  private:
    template <class Table>
    kov::bench::RawTable* begin(std::unique_ptr<Table>& table) {
        table = std::make_unique<Table>(*db_);
        return table.get();
    }

    std::unique_ptr<kov::bench::RawDatabase> db_;
    std::unique_ptr<kov::bench::RawIntTable> ints_;
    std::unique_ptr<kov::bench::RawBlobTable> blobs_;
    std::unique_ptr<kov::bench::RawKeyTable> keys_;
    std::unique_ptr<kov::bench::RawCountTable> counts_;
    kov::bench::RawTable* current_ = nullptr;  // the table begun last
    std::vector<unsigned char> key_;
    std::vector<unsigned char> data_;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_RAW_H
