// RocksDB: a log-structured merge tree. Settings: a 64 MiB LRU block cache
// (the store's cache size), the default 64 MiB write buffer and background
// jobs, the write-ahead log disabled and no syncing (the store keeps no
// journal either). Integer keys are stored as 8 big-endian bytes so the
// bytewise order is the numeric order (the workloads' keys are
// non-negative). Background flushes and compactions run on RocksDB's own
// threads; their processor time is part of the process's. A count of the
// counting workload is a Get and then a Put of 8 bytes.
#ifndef KOVPAGER_BENCH_PEERS_ROCKSDB_H
#define KOVPAGER_BENCH_PEERS_ROCKSDB_H

#include <rocksdb/cache.h>
#include <rocksdb/db.h>
#include <rocksdb/options.h>
#include <rocksdb/table.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/bench_util.h"

namespace kov::peers {

class RocksdbBackend {
  public:
    static constexpr const char* kName = "rocksdb";

    explicit RocksdbBackend(const std::string& scratch) {
        rocksdb::Options options;
        options.create_if_missing = true;
        rocksdb::BlockBasedTableOptions table;
        table.block_cache = rocksdb::NewLRUCache(std::size_t{64} << 20);
        options.table_factory.reset(rocksdb::NewBlockBasedTableFactory(table));
        rocksdb::DB* db = nullptr;
        check(rocksdb::DB::Open(options, scratch + "/db", &db), "open");
        db_.reset(db);
        write_.disableWAL = true;
        write_.sync = false;
    }
    ~RocksdbBackend() {
        iterator_.reset();
        if (db_ != nullptr) {
            db_->Close();
        }
    }
    RocksdbBackend(const RocksdbBackend&) = delete;
    RocksdbBackend& operator=(const RocksdbBackend&) = delete;

    void beginInt() {}
    void beginBlob() {}
    void beginKeys() {}
    void beginCounts() {}

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        unsigned char k[8];
        kov::bench::putBigEndian(k, static_cast<std::uint64_t>(key));
        check(db_->Put(write_, slice(k, sizeof k), slice(data, size)), "put");
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        check(db_->Put(write_, slice(key, keySize), slice(data, dataSize)), "put");
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) {
        check(db_->Put(write_, slice(key, keySize), rocksdb::Slice()), "put");
    }
    void increment(const unsigned char* key, std::size_t keySize) {
        std::uint64_t count = 0;
        if (get(slice(key, keySize)) && value_.size() == sizeof count) {
            std::memcpy(&count, value_.data(), sizeof count);
        }
        ++count;
        check(db_->Put(write_, slice(key, keySize),
                       slice(reinterpret_cast<const unsigned char*>(&count), sizeof count)),
              "put");
    }

    // A new iterator on the first entry (one made now sees every write so
    // far), and the key found.
    bool readable(std::int64_t key) {
        unsigned char k[8];
        kov::bench::putBigEndian(k, static_cast<std::uint64_t>(key));
        return readable(k, sizeof k);
    }
    bool readable(const unsigned char* key, std::size_t keySize) {
        std::unique_ptr<rocksdb::Iterator> it(db_->NewIterator(read_));
        it->SeekToFirst();
        check(it->status(), "first");
        return it->Valid() && get(slice(key, keySize));
    }

    // Every entry in key order, key and data copied out and handed to
    // visit(key, keySize, data, dataSize).
    template <class Visit>
    void scan(Visit&& visit) {
        rocksdb::Iterator* it = iterator();
        for (it->SeekToFirst(); it->Valid(); it->Next()) {
            rocksdb::Slice k = it->key();
            rocksdb::Slice v = it->value();
            key_.assign(k.data(), k.data() + k.size());
            data_.assign(v.data(), v.data() + v.size());
            visit(reinterpret_cast<const unsigned char*>(key_.data()), key_.size(),
                  reinterpret_cast<const unsigned char*>(data_.data()), data_.size());
        }
        check(it->status(), "scan");
    }

    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        if (!get(slice(key, keySize))) {
            return false;
        }
        data_.assign(value_.data(), value_.data() + value_.size());
        tally.add(key, keySize, reinterpret_cast<const unsigned char*>(data_.data()));
        return true;
    }

    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        rocksdb::Iterator* it = iterator();
        rocksdb::Slice p = slice(prefix, prefixSize);
        std::size_t walked = 0;
        for (it->Seek(p); it->Valid() && it->key().starts_with(p); it->Next()) {
            rocksdb::Slice k = it->key();
            key_.assign(k.data() + prefixSize, k.data() + k.size());
            tally.add(prefix, key_.size(), reinterpret_cast<const unsigned char*>(key_.data()));
            ++walked;
        }
        check(it->status(), "walk");
        return walked;
    }

  private:
    // Reads the key's value into value_; false when it is missing.
    bool get(const rocksdb::Slice& key) {
        value_.Reset();
        rocksdb::Status s = db_->Get(read_, db_->DefaultColumnFamily(), key, &value_);
        if (s.IsNotFound()) {
            return false;
        }
        check(s, "get");
        return true;
    }
    static rocksdb::Slice slice(const unsigned char* bytes, std::size_t size) {
        return rocksdb::Slice(reinterpret_cast<const char*>(bytes), size);
    }
    static void check(const rocksdb::Status& s, const char* what) {
        if (!s.ok()) {
            throw std::runtime_error(std::string("rocksdb ") + what + ": " + s.ToString());
        }
    }
    // One iterator for the read phase, made after the last write so it
    // sees every entry.
    rocksdb::Iterator* iterator() {
        if (iterator_ == nullptr) {
            iterator_.reset(db_->NewIterator(read_));
        }
        return iterator_.get();
    }

    std::unique_ptr<rocksdb::DB> db_;
    std::unique_ptr<rocksdb::Iterator> iterator_;
    rocksdb::WriteOptions write_;
    rocksdb::ReadOptions read_;
    rocksdb::PinnableSlice value_;
    std::vector<char> key_;
    std::vector<char> data_;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_ROCKSDB_H
