// A minimal host: one integer-keyed table, a writing cursor, a second table
// created while the cursor is open, then a walk that checks every record; then
// the same store through the C++17 face (<kovpager/kovpager.hpp>).
#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>
#include <kovpager/kovpager.hpp>

#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>

int main() {
    const std::int64_t count = 1000;
    KovBtree table(KovBtree::IntKeyTable);
    {
        KovBtreeCursor writer(table, true);
        for (std::int64_t k = 0; k < count; ++k) {
            std::string data = "record " + std::to_string(k);
            writer.insert(k, data.data(), data.size());
        }
        KovBtree index(KovBtree::IndexTable);  // made while `writer` is open
    }

    KovBtreeCursor reader(table, false);
    std::int64_t seen = 0;
    for (bool on = reader.first(); on; on = reader.next()) {
        std::int64_t key = -1;
        reader.key(key);
        std::string data(static_cast<size_t>(reader.dataSize()), '\0');
        reader.data(data.data(), data.size());
        if (key != seen || data != "record " + std::to_string(key)) {
            std::fprintf(stderr, "consumer: record %lld is wrong\n", static_cast<long long>(seen));
            return 1;
        }
        ++seen;
    }
    if (seen != count) {
        std::fprintf(stderr, "consumer: walked %lld records, expected %lld\n",
                     static_cast<long long>(seen), static_cast<long long>(count));
        return 1;
    }
    std::printf("consumer: %lld records stored and read back\n", static_cast<long long>(seen));

    kovpager::BytesTable users;
    users.put("alice", "admin");
    users.put("albert", "guest");
    users.put("bob", "guest");
    int prefixed = 0;
    for (const auto& e : users.with_prefix("al"))
        prefixed += e.key().substr(0, 2) == "al" ? 1 : 0;
    if (users.get("alice") != std::optional<std::string>("admin") || users.get("carol") ||
        prefixed != 2 || kovpager::failed()) {
        std::fprintf(stderr, "consumer: the face reads back wrong\n");
        return 1;
    }
    std::printf("consumer: the face reads back\n");
    return 0;
}
