// Key material of the peer comparison, computed on the fly so that no
// backend process carries a copy of the workload in memory (its peak memory
// is then the backend's own, plus a few pages).
//
//   RandomKeys keys(n);        // W3..W5: key i is keys.at(i), 16 random bytes,
//                              // the same bytes bench_util's randomKeys gives
//   Shuffle order(n);          // W2: order.at(i) is a permutation of [0, n)
//   CompositeKeys groups;      // W6 (bench_util.h): 1 000 group prefixes, a walk
//                              // order and a generator of (group prefix, payload)
//   SkewedDraws draws(n);      // W7 (bench_util.h): draws.at(i) is the key of draw i,
//                              // a few keys drawn very often, most rarely
//
// Every backend sees the same keys in the same order, so the tallies of the
// read workloads agree across backends (the driver prints them).
#ifndef KOVPAGER_BENCH_PEERS_WORKLOADS_H
#define KOVPAGER_BENCH_PEERS_WORKLOADS_H

#include <cstdint>
#include <cstring>
#include <utility>
#include <vector>

#include "bench/bench_util.h"

namespace kov::peers {

using kov::bench::CompositeKeys;  // W6
using kov::bench::Key16;
using kov::bench::kGolden;
using kov::bench::mix;
using kov::bench::putBigEndian;
using kov::bench::Random;
using kov::bench::SkewedDraws;  // W7

// N random 16-byte keys with random access: key i is keyAt(kSeed, i).
class RandomKeys {
  public:
    static constexpr std::uint64_t kSeed = kov::bench::kWorkloadKeySeed;
    explicit RandomKeys(std::uint64_t n) : n_(n) {}
    std::uint64_t size() const { return n_; }
    Key16 at(std::uint64_t i) const { return kov::bench::keyAt(kSeed, i); }

  private:
    std::uint64_t n_;
};

// A pseudo-random permutation of [0, n): a four-round balanced Feistel
// network on the smallest even power of two that holds n, walking the cycle
// until the value falls inside [0, n).
class Shuffle {
  public:
    explicit Shuffle(std::uint64_t n) : n_(n) {
        while ((std::uint64_t{1} << (2 * half_)) < n) {
            ++half_;
        }
        mask_ = (std::uint64_t{1} << half_) - 1;
    }
    std::uint64_t at(std::uint64_t i) const {
        std::uint64_t v = i;
        do {
            v = round(v);
        } while (v >= n_);
        return v;
    }

  private:
    std::uint64_t round(std::uint64_t v) const {
        std::uint64_t left = v >> half_;
        std::uint64_t right = v & mask_;
        for (std::uint64_t r = 0; r < 4; ++r) {
            std::uint64_t f = mix(right ^ (0x5368756666ULL + r * kGolden)) & mask_;
            std::uint64_t next = left ^ f;
            left = right;
            right = next;
        }
        return (left << half_) | right;
    }

    std::uint64_t n_;
    unsigned half_ = 1;
    std::uint64_t mask_ = 1;
};

}  // namespace kov::peers

#endif  // KOVPAGER_BENCH_PEERS_WORKLOADS_H
