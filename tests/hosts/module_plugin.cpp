// A host module of the store, for the load and unload tests: a shared object (a DLL on Windows)
// that links the shared library and drives one integer-keyed table through a C interface, so that
// a test program can load it with dlopen (LoadLibrary), fill the store and unload both again.
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>

#if defined(_WIN32)
#define KOV_PLUGIN_API extern "C" __declspec(dllexport)
#else
#define KOV_PLUGIN_API extern "C" __attribute__((visibility("default")))
#endif

namespace {

std::unique_ptr<KovBtree> gTable;
std::unique_ptr<KovBtreeCursor> gCursor;

// The data of record `key`: `size` bytes that depend on the key and on their offset.
void fillRecord(std::int64_t key, std::string& out) {
    for (std::size_t j = 0; j < out.size(); ++j)
        out[j] = static_cast<char>((static_cast<std::uint64_t>(key) * 31u + j) & 0xFFu);
}

}  // namespace

// Makes the table and a writing cursor on it (the first call brings the store into being).
KOV_PLUGIN_API void kovplug_open() {
    gTable = std::make_unique<KovBtree>(KovBtree::IntKeyTable);
    gCursor = std::make_unique<KovBtreeCursor>(*gTable, true);
}

// Inserts keys first .. first + count - 1, each with `size` bytes of data.
KOV_PLUGIN_API void kovplug_insert(std::int64_t first, std::int64_t count, std::uint32_t size) {
    std::string data(size, '\0');
    for (std::int64_t key = first; key < first + count; ++key) {
        fillRecord(key, data);
        gCursor->insert(key, data.data(), data.size());
    }
}

// Walks the table; returns the number of records when each one holds the data it was given,
// -1 at the first record that does not.
KOV_PLUGIN_API std::int64_t kovplug_verify() {
    std::int64_t count = 0;
    std::string expected;
    std::string actual;
    for (bool on = gCursor->first(); on; on = gCursor->next()) {
        std::int64_t key = 0;
        gCursor->key(key);
        const std::int64_t size = gCursor->dataSize();
        expected.assign(static_cast<std::size_t>(size), '\0');
        fillRecord(key, expected);
        actual.assign(static_cast<std::size_t>(size), '\0');
        gCursor->data(actual.data(), actual.size());
        if (actual != expected)
            return -1;
        ++count;
    }
    return count;
}

// Destroys the cursor, then the table.
KOV_PLUGIN_API void kovplug_close() {
    gCursor.reset();
    gTable.reset();
}
