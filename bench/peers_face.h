// The store through its C++17 face (<kovpager/kovpager.hpp>), as a host that uses it would: one
// table of the workload's kind for the whole run; reads through range-for walks and get_view(),
// keys and data read in place.
#ifndef KOVPAGER_BENCH_PEERS_FACE_H
#define KOVPAGER_BENCH_PEERS_FACE_H

#include <kovpager/kovpager.hpp>

#include <cstdint>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "bench/bench_util.h"

namespace kov::peers {

class FaceBackend {
  public:
    static constexpr const char* kName = "face";

    explicit FaceBackend(const std::string& /*scratch: KOV_TEMP names it*/) {}

    void beginInt() { ints_ = std::make_unique<kovpager::IntTable>(); }
    void beginBlob() { bytes_ = std::make_unique<kovpager::BytesTable>(); }
    void beginKeys() { keys_ = std::make_unique<kovpager::IndexTable>(); }
    void beginCounts() { bytes_ = std::make_unique<kovpager::BytesTable>(); }

    void intInsert(std::int64_t key, const unsigned char* data, std::size_t size) {
        ints_->put(key, view(data, size));
    }
    void blobInsert(const unsigned char* key, std::size_t keySize, const unsigned char* data,
                    std::size_t dataSize) {
        bytes_->put(view(key, keySize), view(data, dataSize));
    }
    void keyInsert(const unsigned char* key, std::size_t keySize) { keys_->put(view(key, keySize)); }
    void increment(const unsigned char* key, std::size_t keySize) {
        std::uint64_t count = 0;
        if (const std::optional<std::string_view> old = bytes_->get_view(view(key, keySize)))
            std::memcpy(&count, old->data(), old->size() < sizeof count ? old->size() : sizeof count);
        ++count;
        bytes_->put(view(key, keySize),
                    std::string_view(reinterpret_cast<const char*>(&count), sizeof count));
    }

    bool readable(std::int64_t key) {
        return ints_->begin() != ints_->end() && ints_->get(key).has_value();
    }
    bool readable(const unsigned char* key, std::size_t keySize) {
        if (keys_ != nullptr)
            return keys_->begin() != keys_->end() && keys_->contains(view(key, keySize));
        return bytes_->begin() != bytes_->end() && bytes_->get(view(key, keySize)).has_value();
    }

    // Every entry in key order, handed to visit(key, keySize, data, dataSize) in place.
    template <class Visit>
    void scan(Visit&& visit) {
        for (const auto& e : *bytes_) {
            const std::string_view key = e.key();
            const std::string_view data = e.data();
            visit(bytes(key), key.size(), bytes(data), data.size());
        }
    }

    // A point seek with the data read; false when the key is missing.
    bool seek(const unsigned char* key, std::size_t keySize, kov::bench::Tally& tally) {
        const std::optional<std::string_view> data = bytes_->get_view(view(key, keySize));
        if (!data.has_value())
            return false;
        tally.add(key, keySize, reinterpret_cast<const unsigned char*>(data->data()));
        return true;
    }

    // Every entry whose key begins with the prefix; returns how many.
    std::size_t walk(const unsigned char* prefix, std::size_t prefixSize,
                     kov::bench::Tally& tally) {
        std::size_t walked = 0;
        for (const auto& e : keys_->with_prefix(view(prefix, prefixSize))) {
            const std::string_view payload = e.key().substr(prefixSize);
            tally.add(prefix, payload.size(), bytes(payload));
            ++walked;
        }
        return walked;
    }

  private:
    static std::string_view view(const unsigned char* p, std::size_t n) {
        return {reinterpret_cast<const char*>(p), n};
    }
    static const unsigned char* bytes(std::string_view v) {
        return reinterpret_cast<const unsigned char*>(v.data());
    }

    // Destroyed in reverse order; each owns its table and cursors.
    std::unique_ptr<kovpager::IntTable> ints_;
    std::unique_ptr<kovpager::BytesTable> bytes_;
    std::unique_ptr<kovpager::IndexTable> keys_;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_FACE_H
