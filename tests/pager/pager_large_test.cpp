// The store holding more than ten times its page cache: 11 000 records of 64 KiB under
// sequential integer keys (about 690 MiB of data against a 64 MiB cache), every one read back and
// compared byte for byte, then a sample found again by seek after a table creation.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <random>
#include <string>

#include "pager_test_util.h"

using namespace kovtest;

namespace {

constexpr std::int64_t kRecords = 11000;
constexpr std::size_t kDataSize = 64 * 1024;

// The data of one record: a fixed random block with the key stamped at its start, middle and
// end, so that every record differs from every other one and a misplaced page shows.
class RecordData {
  public:
    RecordData() : block_(kDataSize, '\0') {
        std::mt19937_64 rng(20261122);
        for (std::size_t i = 0; i < kDataSize; i += 8) {
            const std::uint64_t v = rng();
            std::memcpy(&block_[i], &v, 8);
        }
    }
    const std::string& of(std::int64_t key) {
        for (std::size_t at : {std::size_t{0}, kDataSize / 2, kDataSize - 8}) {
            std::memcpy(&block_[at], &key, 8);
        }
        return block_;
    }

  private:
    std::string block_;
};

}  // namespace

TEST(PagerLarge, TenTimesTheCacheComesBackIntact) {
    static_assert(kRecords * static_cast<std::int64_t>(kDataSize) > 640LL * 1024 * 1024,
                  "more than ten times the 64 MiB cache");
    KovBtree table(KovBtree::IntKeyTable);
    RecordData expected;
    {
        KovBtreeCursor writer(table, true);
        for (std::int64_t k = 0; k < kRecords; ++k) {
            const std::string& d = expected.of(k);
            writer.insert(k, d.data(), d.size());
        }
    }

    KovBtreeCursor reader(table, false);
    std::string got(kDataSize, '\0');
    std::int64_t next = 0;
    for (bool on = reader.first(); on; on = reader.next()) {
        ASSERT_EQ(intKey(reader), next);
        ASSERT_EQ(reader.dataSize(), static_cast<std::int64_t>(kDataSize)) << next;
        reader.data(got.data(), got.size());
        ASSERT_TRUE(got == expected.of(next)) << "record " << next << " differs";
        ++next;
    }
    EXPECT_EQ(next, kRecords);

    // Positions survive a table creation at this size too.
    ASSERT_EQ(reader.seek(kRecords / 3), 0);
    KovBtree other(KovBtree::BlobTable);
    ASSERT_TRUE(reader.good());
    EXPECT_EQ(intKey(reader), kRecords / 3);
    std::mt19937 rng(7);
    for (int i = 0; i < 200; ++i) {
        const std::int64_t k = std::uniform_int_distribution<std::int64_t>(0, kRecords - 1)(rng);
        ASSERT_EQ(reader.seek(k), 0);
        reader.data(got.data(), got.size());
        ASSERT_TRUE(got == expected.of(k)) << "record " << k << " differs";
    }
    EXPECT_EQ(storeIntegrityProblems(), "");
}
