// LMDB: a copy-on-write B+tree in one memory map. Settings chosen to match
// the store's scratch use: a 64 GiB map (address space only; the file is
// sparse), MDB_NOSYNC | MDB_WRITEMAP | MDB_NOMETASYNC (writes go straight
// into the map, nothing is flushed), and one write transaction for the whole
// run, aborted at the end like the store's never-committed transaction.
// Integer keys use MDB_INTEGERKEY (native 8-byte unsigned; the workloads'
// keys are non-negative). The page cache is the kernel's: LMDB has no cache
// size of its own. A count of the counting workload is read with mdb_get and
// written with mdb_put, 8 bytes, in the one write transaction.
#ifndef KOVPAGER_BENCH_PEERS_LMDB_H
#define KOVPAGER_BENCH_PEERS_LMDB_H

#include <lmdb.h>

#include <cstdint>
#include <cstring>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/bench_util.h"

namespace kov::peers {

class LmdbBackend {
  public:
    static constexpr const char* kName = "lmdb";
    static constexpr std::size_t kMapSize = std::size_t{64} << 30;

    explicit LmdbBackend(const std::string& scratch) {
        check(mdb_env_create(&env_), "env_create");
        check(mdb_env_set_mapsize(env_, kMapSize), "set_mapsize");
        check(mdb_env_set_maxdbs(env_, 4), "set_maxdbs");
        check(mdb_env_open(env_, scratch.c_str(), MDB_NOSYNC | MDB_WRITEMAP | MDB_NOMETASYNC, 0600),
              "env_open");
        check(mdb_txn_begin(env_, nullptr, 0, &txn_), "txn_begin");
    }
    ~LmdbBackend() {
        if (cursor_ != nullptr) {
            mdb_cursor_close(cursor_);
        }
        if (txn_ != nullptr) {
            mdb_txn_abort(txn_);
        }
        mdb_env_close(env_);
    }
    LmdbBackend(const LmdbBackend&) = delete;
    LmdbBackend& operator=(const LmdbBackend&) = delete;

    void beginInt() { open("ints", MDB_INTEGERKEY); }
    void beginBlob() { open("blobs", 0); }
    void beginKeys() { open("keys", 0); }
    void beginCounts() { open("counts", 0); }

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        auto k = static_cast<std::uint64_t>(key);
        MDB_val kv{sizeof k, &k};
        MDB_val dv{size, const_cast<unsigned char*>(data)};
        check(mdb_put(txn_, dbi_, &kv, &dv, 0), "put");
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        MDB_val kv{keySize, const_cast<unsigned char*>(key)};
        MDB_val dv{dataSize, const_cast<unsigned char*>(data)};
        check(mdb_put(txn_, dbi_, &kv, &dv, 0), "put");
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) {
        MDB_val kv{keySize, const_cast<unsigned char*>(key)};
        MDB_val dv{0, nullptr};
        check(mdb_put(txn_, dbi_, &kv, &dv, 0), "put");
    }
    void increment(const unsigned char* key, std::size_t keySize) {
        MDB_val kv{keySize, const_cast<unsigned char*>(key)};
        MDB_val dv;
        std::uint64_t count = 0;
        int rc = mdb_get(txn_, dbi_, &kv, &dv);
        if (rc == 0 && dv.mv_size == sizeof count) {
            std::memcpy(&count, dv.mv_data, sizeof count);
        } else if (rc != MDB_NOTFOUND) {
            check(rc == 0 ? MDB_CORRUPTED : rc, "get");
        }
        ++count;
        dv = MDB_val{sizeof count, &count};
        check(mdb_put(txn_, dbi_, &kv, &dv, 0), "put");
    }

    // A cursor on the first entry, and the key found.
    bool readable(std::int64_t key) {
        auto k = static_cast<std::uint64_t>(key);
        return readBack(MDB_val{sizeof k, &k});
    }
    bool readable(const unsigned char* key, std::size_t keySize) {
        return readBack(MDB_val{keySize, const_cast<unsigned char*>(key)});
    }

    // Every entry in key order, key and data copied out and handed to
    // visit(key, keySize, data, dataSize).
    template <class Visit>
    void scan(Visit&& visit) {
        MDB_val kv;
        MDB_val dv;
        for (int rc = mdb_cursor_get(cursor(), &kv, &dv, MDB_FIRST); rc == 0;
             rc = mdb_cursor_get(cursor_, &kv, &dv, MDB_NEXT)) {
            key_.resize(kv.mv_size);
            std::memcpy(key_.data(), kv.mv_data, kv.mv_size);
            data_.resize(dv.mv_size);
            std::memcpy(data_.data(), dv.mv_data, dv.mv_size);
            visit(key_.data(), key_.size(), data_.data(), data_.size());
        }
    }

    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        MDB_val kv{keySize, const_cast<unsigned char*>(key)};
        MDB_val dv;
        if (mdb_get(txn_, dbi_, &kv, &dv) != 0) {
            return false;
        }
        data_.resize(dv.mv_size);
        std::memcpy(data_.data(), dv.mv_data, dv.mv_size);
        tally.add(key, keySize, data_.data());
        return true;
    }

    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        MDB_val kv{prefixSize, const_cast<unsigned char*>(prefix)};
        MDB_val dv;
        std::size_t walked = 0;
        for (int rc = mdb_cursor_get(cursor(), &kv, &dv, MDB_SET_RANGE);
             rc == 0 && kv.mv_size >= prefixSize &&
             std::memcmp(kv.mv_data, prefix, prefixSize) == 0;
             rc = mdb_cursor_get(cursor_, &kv, &dv, MDB_NEXT)) {
            std::size_t size = kv.mv_size - prefixSize;
            key_.resize(size);
            std::memcpy(key_.data(), static_cast<const unsigned char*>(kv.mv_data) + prefixSize,
                        size);
            tally.add(prefix, size, key_.data());
            ++walked;
        }
        return walked;
    }

  private:
    bool readBack(MDB_val key) {
        MDB_val kv;
        MDB_val dv;
        return mdb_cursor_get(cursor(), &kv, &dv, MDB_FIRST) == 0 &&
               mdb_get(txn_, dbi_, &key, &dv) == 0;
    }
    void open(const char* name, unsigned flags) {
        check(mdb_dbi_open(txn_, name, MDB_CREATE | flags, &dbi_), "dbi_open");
    }
    MDB_cursor* cursor() {
        if (cursor_ == nullptr) {
            check(mdb_cursor_open(txn_, dbi_, &cursor_), "cursor_open");
        }
        return cursor_;
    }
    static void check(int rc, const char* what) {
        if (rc != 0) {
            throw std::runtime_error(std::string("lmdb ") + what + ": " + mdb_strerror(rc));
        }
    }

    MDB_env* env_ = nullptr;
    MDB_txn* txn_ = nullptr;
    MDB_dbi dbi_ = 0;
    MDB_cursor* cursor_ = nullptr;
    std::vector<unsigned char> key_;
    std::vector<unsigned char> data_;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_LMDB_H
