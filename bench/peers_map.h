// std::map: the in-memory ceiling. Everything lives in the heap, nothing
// goes to disk; the data of every entry is a fixed 100-byte array, a count
// of the counting workload a std::uint64_t.
#ifndef KOVPAGER_BENCH_PEERS_MAP_H
#define KOVPAGER_BENCH_PEERS_MAP_H

#include <array>
#include <cstdint>
#include <cstring>
#include <map>
#include <set>
#include <string>

#include "bench/bench_util.h"

namespace kov::peers {

class MapBackend {
  public:
    static constexpr const char* kName = "map";
    using Data = std::array<unsigned char, kov::bench::kDataSize>;
    using Key16 = kov::bench::Key16;

    explicit MapBackend(const std::string& /*scratch: unused*/) {}

    void beginInt() { current_ = Table::kInts; }
    void beginBlob() { current_ = Table::kBlobs; }
    void beginKeys() { current_ = Table::kKeys; }
    void beginCounts() { current_ = Table::kCounts; }

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        ints_.insert_or_assign(key, toData(data, size));
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        blobs_.insert_or_assign(toKey(key, keySize), toData(data, dataSize));
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) {
        keys_.insert(toKey(key, keySize));
    }
    // A lookup, then the write: find and operator[].
    void increment(const unsigned char* key, std::size_t keySize) {
        Key16 k = toKey(key, keySize);
        auto it = counts_.find(k);
        std::uint64_t count = it == counts_.end() ? 1 : it->second + 1;
        counts_[k] = count;
    }

    // The table begun last has a first entry and holds the key.
    bool readable(std::int64_t key) { return readBack(ints_, key); }
    bool readable(const unsigned char* key, std::size_t keySize) {
        Key16 k = toKey(key, keySize);
        switch (current_) {
            case Table::kBlobs:
                return readBack(blobs_, k);
            case Table::kKeys:
                return readBack(keys_, k);
            case Table::kCounts:
                return readBack(counts_, k);
            case Table::kInts:
                break;
        }
        return false;
    }

    // The byte-keyed entries, or the counts once the counting workload has
    // begun (each count handed over as its 8 bytes).
    template <class Visit>
    void scan(Visit&& visit) {
        if (current_ == Table::kCounts) {
            for (const auto& entry : counts_) {
                Key16 key = entry.first;
                std::uint64_t count = entry.second;
                visit(key.data(), key.size(), reinterpret_cast<const unsigned char*>(&count),
                      sizeof count);
            }
            return;
        }
        for (const auto& entry : blobs_) {
            Key16 key = entry.first;
            Data data = entry.second;
            visit(key.data(), key.size(), data.data(), data.size());
        }
    }

    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        auto it = blobs_.find(toKey(key, keySize));
        if (it == blobs_.end()) {
            return false;
        }
        Data data = it->second;
        tally.add(key, keySize, data.data());
        return true;
    }

    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        std::size_t walked = 0;
        for (auto it = keys_.lower_bound(toKey(prefix, prefixSize));
             it != keys_.end() && std::memcmp(it->data(), prefix, prefixSize) == 0; ++it) {
            unsigned char payload[sizeof(Key16)];
            std::memcpy(payload, it->data() + prefixSize, it->size() - prefixSize);
            tally.add(prefix, it->size() - prefixSize, payload);
            ++walked;
        }
        return walked;
    }

  private:
    enum class Table { kInts, kBlobs, kKeys, kCounts };

    template <class Container, class Key>
    static bool readBack(const Container& c, const Key& key) {
        return c.begin() != c.end() && c.find(key) != c.end();
    }

    // Keys are at most 16 bytes here; a shorter key is padded with zero bytes.
    static Key16 toKey(const unsigned char* key, std::size_t size) {
        Key16 k{};
        std::memcpy(k.data(), key, size < k.size() ? size : k.size());
        return k;
    }
    static Data toData(const unsigned char* data, std::size_t size) {
        Data d{};
        std::memcpy(d.data(), data, size < d.size() ? size : d.size());
        return d;
    }

    std::map<std::int64_t, Data> ints_;
    std::map<Key16, Data> blobs_;
    std::set<Key16> keys_;
    std::map<Key16, std::uint64_t> counts_;
    Table current_ = Table::kInts;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_MAP_H
