// A host that uses SQLite itself, beside the store: this program links the system's SQLite and
// the shared library, as such a host does. The store carries its own SQLite inside; the host's
// SQLite, its temporary-directory setting and its temporary files must not notice the store,
// and the store's temporary file must go where KOV_TEMP says, whatever the host set.
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <sqlite3.h>

#include <kovpager/KovBtree.h>
#include <kovpager/KovBtreeCursor.h>
#include <kovpager/KovPager.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "scratch_directory.h"

namespace fs = std::filesystem;

namespace {

// The files this process holds open inside `dir` (temporary files are unlinked at once, so they
// show only here).
std::vector<std::string> openFilesIn(const std::string& dir) {
    std::vector<std::string> found;
    std::error_code ec;
    for (fs::directory_iterator it("/proc/self/fd", ec), end; !ec && it != end; it.increment(ec)) {
        std::error_code linkError;
        const std::string target = fs::read_symlink(it->path(), linkError).string();
        if (!linkError && target.compare(0, dir.size() + 1, dir + "/") == 0)
            found.push_back(target);
    }
    return found;
}

void exec(sqlite3* db, const char* sql) {
    char* message = nullptr;
    ASSERT_EQ(sqlite3_exec(db, sql, nullptr, nullptr, &message), SQLITE_OK)
        << sql << ": " << (message != nullptr ? message : "");
    sqlite3_free(message);
}

// A temporary database of the host's that spills to a file: a cache of 10 pages and a few MB.
void fillHostDatabase(sqlite3* db) {
    exec(db, "PRAGMA cache_size=10");
    exec(db, "CREATE TABLE t(k INTEGER PRIMARY KEY, v BLOB)");
    exec(db, "BEGIN");
    exec(db, "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 5000) "
             "INSERT INTO t SELECT i, randomblob(1000) FROM n");
}

std::int64_t hostRows(sqlite3* db) {
    sqlite3_stmt* s = nullptr;
    std::int64_t rows = -1;
    if (sqlite3_prepare_v2(db, "SELECT count(*) FROM t", -1, &s, nullptr) == SQLITE_OK &&
        sqlite3_step(s) == SQLITE_ROW)
        rows = sqlite3_column_int64(s, 0);
    sqlite3_finalize(s);
    return rows;
}

}  // namespace

TEST(SqliteHost, HostSqliteKeepsItsTemporaryDirectoryAndFilesWhileTheStoreSpills) {
    const kov::test::ScratchDirectory hostScratch("kov-host-sqlite-");
    const kov::test::ScratchDirectory storeScratch("kov-host-store-");
    const std::string& hostDir = hostScratch.path();
    const std::string& storeDir = storeScratch.path();
    ASSERT_FALSE(hostDir.empty() || storeDir.empty()) << "no scratch directories";
    ASSERT_EQ(::setenv("KOV_TEMP", storeDir.c_str(), 1), 0);

    // The host sets its SQLite's temporary directory before anything else and opens a temporary
    // database of its own that spills there.
    char* hostSetting = sqlite3_mprintf("%s", hostDir.c_str());
    sqlite3_temp_directory = hostSetting;
    sqlite3* db = nullptr;
    ASSERT_EQ(sqlite3_open_v2("", &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr),
              SQLITE_OK);
    fillHostDatabase(db);
    ASSERT_FALSE(::testing::Test::HasFatalFailure());
    const std::vector<std::string> hostFilesBefore = openFilesIn(hostDir);
    ASSERT_EQ(hostFilesBefore.size(), 1u) << "the host's database spilled to its directory";

    // The store fills past its 64 MiB page cache, so its engine's file exists.
    {
        KovBtree table(KovBtree::IntKeyTable);
        KovBtreeCursor cursor(table, true);
        const std::string data(1024, 's');
        for (std::int64_t k = 0; k < 80000; ++k)
            cursor.insert(k, data.data(), data.size());
        EXPECT_EQ(openFilesIn(storeDir).size(), 1u) << "the store spilled to KOV_TEMP";

        // The host's setting is the host's own pointer, with the host's text.
        EXPECT_EQ(sqlite3_temp_directory, hostSetting);
        EXPECT_EQ(std::string(sqlite3_temp_directory), hostDir);
        // Its file is where it was, the store has none there and it has none in the store's.
        EXPECT_EQ(openFilesIn(hostDir), hostFilesBefore);

        // The host's SQLite goes on working, and a second temporary database of the host's
        // still spills into the host's directory.
        EXPECT_EQ(hostRows(db), 5000);
        sqlite3* second = nullptr;
        ASSERT_EQ(sqlite3_open_v2("", &second, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE,
                                  nullptr),
                  SQLITE_OK);
        fillHostDatabase(second);
        EXPECT_EQ(openFilesIn(hostDir).size(), 2u);
        EXPECT_EQ(openFilesIn(storeDir).size(), 1u);
        sqlite3_close(second);

        // The store's records are whole.
        std::int64_t walked = 0;
        for (bool on = cursor.first(); on; on = cursor.next()) {
            std::int64_t key = -1;
            cursor.key(key);
            EXPECT_EQ(key, walked);
            ++walked;
        }
        EXPECT_EQ(walked, 80000);
    }
    KovPager::instance()->reset();
    EXPECT_TRUE(openFilesIn(storeDir).empty());
    EXPECT_EQ(openFilesIn(hostDir), hostFilesBefore);
    EXPECT_EQ(hostRows(db), 5000);
    EXPECT_EQ(sqlite3_close(db), SQLITE_OK);
    EXPECT_TRUE(openFilesIn(hostDir).empty());
    sqlite3_temp_directory = nullptr;
    sqlite3_free(hostSetting);
}

// The library brings none of SQLite's names into the host: the host's calls reach the system's
// SQLite library, and the store's library holds no SQLite name a host could bind to.
TEST(SqliteHost, TheHostsSqliteNamesReachTheSystemLibrary) {
    Dl_info info{};
    ASSERT_NE(::dladdr(reinterpret_cast<void*>(&sqlite3_open_v2), &info), 0);
    ASSERT_NE(info.dli_fname, nullptr);
    EXPECT_NE(std::string(info.dli_fname).find("libsqlite3"), std::string::npos) << info.dli_fname;

    ASSERT_NE(::dladdr(reinterpret_cast<void*>(&KovPager::instance), &info), 0);
    void* store = ::dlopen(info.dli_fname, RTLD_NOW | RTLD_NOLOAD);
    ASSERT_NE(store, nullptr) << info.dli_fname;
    for (const char* name : {"sqlite3_open_v2", "sqlite3_temp_directory",
                             "kovpager_sqlite3_open_v2", "kovpager_sqlite3_temp_directory"})
        EXPECT_EQ(::dlsym(store, name), nullptr) << name;
    ::dlclose(store);
}
