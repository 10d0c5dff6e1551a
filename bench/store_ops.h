// What the store programs (store_benchmark, peers_benchmark) do through a
// writing KovBtreeCursor beyond plain inserts and walks, written once: a
// draw of the counting workload, and the read back every insert workload
// ends with.
#ifndef KOVPAGER_BENCH_STORE_OPS_H
#define KOVPAGER_BENCH_STORE_OPS_H

#include <kovpager/KovBtreeCursor.h>

#include <cstdint>

namespace kov::bench {

// Counts the key once more in a BlobTable of 8-byte counts: a seek, the
// count read when the key is there, and an insert of count + 1 (of 1 when it
// is not).
inline void storeIncrement(KovBtreeCursor& c, const unsigned char* key, std::size_t keySize) {
    std::uint64_t count = 0;
    if (c.seek(key, keySize) == 0) {
        c.data(&count, sizeof count);
    }
    ++count;
    c.insert(key, keySize, &count, sizeof count);
}

// True when first() lands on an entry and a seek finds the key: the
// inserted entries read back (bench_util.h, requireReadable).
inline bool storeReadable(KovBtreeCursor& c, const void* key, std::size_t keySize) {
    return c.first() && c.seek(key, keySize) == 0;
}
inline bool storeReadable(KovBtreeCursor& c, std::int64_t key) {
    return c.first() && c.seek(key) == 0;
}

}  // namespace kov::bench

#endif  // KOVPAGER_BENCH_STORE_OPS_H
