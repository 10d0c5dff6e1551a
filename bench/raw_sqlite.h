// The raw baseline the benchmarks measure the store against: SQLite driven
// by hand, with exactly the store's settings and nothing in between.
//
// One RawDatabase is one private connection on a temporary on-disk database
// (opened with the empty file name, deleted by SQLite on close), with the
// store's page size and page-cache size (read from KovPager through
// KovTestAccess: 4096-byte pages, 16384 of them), no journal, the exclusive
// lock, no syncing, and one exclusive transaction that is never committed:
// the database lives and dies as scratch space, as the store's does.
//
// Three table kinds mirror the store's, and a fourth holds counts:
//   RawIntTable    (k INTEGER PRIMARY KEY, v BLOB)
//   RawBlobTable   (k BLOB PRIMARY KEY, v BLOB) WITHOUT ROWID
//   RawKeyTable    (k BLOB PRIMARY KEY) WITHOUT ROWID
//   RawCountTable  (key BLOB PRIMARY KEY, count INTEGER) WITHOUT ROWID
// Each table prepares its statements once, at construction, and reuses them.
// Inserts replace an entry with an equal key, the store's rule too: INSERT
// OR REPLACE where there is data; on key-only tables INSERT OR IGNORE, which
// comes to the same (an equal key is the same entry) and costs less. The
// count table's one write is an upsert (INSERT ... ON CONFLICT DO UPDATE),
// the way SQL counts in one statement what the store counts with a seek, a
// read and an insert. Byte keys are always bound as blobs (a zero-length key
// as a zero-length blob, never NULL), so they compare bytewise unsigned,
// shorter first. Every table can say whether its entries read back
// (readable: its first entry in key order and one key looked up), the check
// each insert workload ends with.
//
// Every failure throws RawError with SQLite's message. Tables hold
// statements of their database: destroy them before the database.
//
// At the end, the raw side of the workloads the engine and store programs
// pair with their measured side (rawIntInserts, rawBlobInserts, ...).
//
//     kov::bench::RawDatabase db;
//     kov::bench::RawBlobTable t(db);
//     t.insert("k", 1, "v", 1);
//     for (RawScan& s = t.scan(); s.step();) use(s.blob(0), s.bytes(0));
//
// Threads: one thread at a time per database (the connection is opened
// without SQLite's own mutex).
#ifndef KOVPAGER_BENCH_RAW_SQLITE_H
#define KOVPAGER_BENCH_RAW_SQLITE_H

#include <sqlite3.h>

#include <cstdint>
#include <cstring>
#include <stdexcept>
#include <string>
#include <vector>

#include "bench/bench_util.h"
#include "kov_test_access.h"

namespace kov::bench {

// A failure reported by SQLite, with its message.
class RawError : public std::runtime_error {
  public:
    explicit RawError(const std::string& what) : std::runtime_error(what) {}
};

// One prepared statement, finalized on destruction.
class RawStatement {
  public:
    RawStatement(sqlite3* db, const std::string& sql) : db_(db) {
        if (sqlite3_prepare_v3(db, sql.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &stmt_, nullptr) !=
            SQLITE_OK) {
            throw RawError("prepare \"" + sql + "\": " + sqlite3_errmsg(db));
        }
    }
    ~RawStatement() { sqlite3_finalize(stmt_); }
    RawStatement(const RawStatement&) = delete;
    RawStatement& operator=(const RawStatement&) = delete;

    sqlite3_stmt* get() const { return stmt_; }

    // Binds bytes as a blob that SQLite does not copy: the bytes must stay
    // put until the statement is reset.
    void bindBlob(int index, const void* bytes, std::size_t size) {
        // A null pointer would bind NULL, not an empty blob.
        int rc = size == 0 ? sqlite3_bind_zeroblob(stmt_, index, 0)
                           : sqlite3_bind_blob(stmt_, index, bytes, static_cast<int>(size),
                                               SQLITE_STATIC);
        check(rc, "bind");
    }
    void bindInt(int index, std::int64_t value) {
        check(sqlite3_bind_int64(stmt_, index, value), "bind");
    }

    // Runs a statement that returns no row, then resets it.
    void run() {
        int rc = sqlite3_step(stmt_);
        sqlite3_reset(stmt_);
        if (rc != SQLITE_DONE) {
            fail("step");
        }
    }

    // Steps once: true on a row; false when done, the statement then reset.
    bool step() {
        int rc = sqlite3_step(stmt_);
        if (rc == SQLITE_ROW) {
            return true;
        }
        sqlite3_reset(stmt_);
        if (rc != SQLITE_DONE) {
            fail("step");
        }
        return false;
    }
    void reset() { sqlite3_reset(stmt_); }

    // Column readers for the current row. A blob pointer stays valid until
    // the next step or reset.
    const void* blob(int column) const { return sqlite3_column_blob(stmt_, column); }
    std::size_t bytes(int column) const {
        return static_cast<std::size_t>(sqlite3_column_bytes(stmt_, column));
    }
    std::int64_t integer(int column) const { return sqlite3_column_int64(stmt_, column); }

    // Steps over up to `count` rows, copying each row's key and data
    // (columns 0 and 1) into the buffers and handing them to
    // visit(key, keySize, data): a scan that reads what it walks.
    template <typename Visit>
    void copyRows(std::size_t count, std::vector<unsigned char>& keyBuf,
                  std::vector<unsigned char>& dataBuf, Visit visit) {
        for (std::size_t i = 0; i < count && step(); ++i) {
            std::size_t keySize = bytes(0);
            std::size_t dataSize = bytes(1);
            if (keySize > keyBuf.size() || dataSize > dataBuf.size()) {
                throw std::runtime_error("raw scan: entry larger than expected");
            }
            std::memcpy(keyBuf.data(), blob(0), keySize);
            std::memcpy(dataBuf.data(), blob(1), dataSize);
            visit(keyBuf.data(), keySize, dataBuf.data());
        }
    }

  private:
    void check(int rc, const char* what) {
        if (rc != SQLITE_OK) {
            fail(what);
        }
    }
    [[noreturn]] void fail(const char* what) {
        throw RawError(std::string(what) + ": " + sqlite3_errmsg(db_));
    }

    sqlite3* db_;
    sqlite3_stmt* stmt_ = nullptr;
};

// A scan is the table's ordered-walk statement: step() until false.
using RawScan = RawStatement;

// One connection on one private temporary database, transaction open.
class RawDatabase {
  public:
    RawDatabase() {
        int rc = sqlite3_open_v2(
            "", &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX, nullptr);
        if (rc != SQLITE_OK) {
            std::string message = db_ != nullptr ? sqlite3_errmsg(db_) : sqlite3_errstr(rc);
            sqlite3_close(db_);
            throw RawError("open: " + message);
        }
        try {
            exec("PRAGMA page_size=" + std::to_string(KovTestAccess::defaultPageSize()));
            exec("PRAGMA cache_size=" + std::to_string(KovTestAccess::defaultCacheSize()));
            exec("PRAGMA journal_mode=OFF");
            exec("PRAGMA locking_mode=EXCLUSIVE");
            exec("PRAGMA synchronous=OFF");
            exec("BEGIN EXCLUSIVE");
        } catch (...) {
            sqlite3_close(db_);
            throw;
        }
    }
    // Never committed: closing discards the transaction and the file.
    // close_v2 tolerates statements still alive (it waits for them).
    ~RawDatabase() { sqlite3_close_v2(db_); }
    RawDatabase(const RawDatabase&) = delete;
    RawDatabase& operator=(const RawDatabase&) = delete;

    sqlite3* handle() const { return db_; }

    void exec(const std::string& sql) {
        char* error = nullptr;
        if (sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &error) != SQLITE_OK) {
            std::string message = error != nullptr ? error : sqlite3_errmsg(db_);
            sqlite3_free(error);
            throw RawError("\"" + sql + "\": " + message);
        }
    }

    // Creates a table with a fresh name and the given column list and
    // options ("(k BLOB PRIMARY KEY) WITHOUT ROWID"); returns its name.
    std::string createTable(const std::string& definition) {
        std::string name = "t" + std::to_string(++tables_);
        exec("CREATE TABLE " + name + definition);
        return name;
    }

  private:
    sqlite3* db_ = nullptr;
    int tables_ = 0;
};

// What every table has: the walk of every entry in key order and the lookup
// of one key, which together read the table back.
class RawTable {
  public:
    // The ordered walk: the key column first, then the table's others.
    RawScan& scan() { return scan_; }

    // True when the first entry in key order is read and an entry with this
    // key is found (an integer key on RawIntTable, bytes on the others).
    bool readable(std::int64_t key) {
        find_.bindInt(1, key);
        return readBack();
    }
    bool readable(const void* key, std::size_t size) {
        find_.bindBlob(1, key, size);
        return readBack();
    }

  protected:
    // `columns` names the key column first.
    RawTable(RawDatabase& db, const std::string& name, const std::string& keyColumn,
             const std::string& columns)
        : scan_(db.handle(), "SELECT " + columns + " FROM " + name + " ORDER BY " + keyColumn),
          find_(db.handle(), "SELECT 1 FROM " + name + " WHERE " + keyColumn + " = ?1") {}

  private:
    bool readBack() {
        bool first = scan_.step();
        if (first) {
            scan_.reset();
        }
        bool found = find_.step();
        if (found) {
            find_.reset();
        }
        return first && found;
    }

    RawScan scan_;
    RawStatement find_;
};

// What the tables with data share: the replacing insert of (k, v), whose
// parameters the table binds. Scan columns: 0 = key, 1 = data.
class RawDataTable : public RawTable {
  protected:
    RawDataTable(RawDatabase& db, const std::string& name)
        : RawTable(db, name, "k", "k, v"),
          insert_(db.handle(), "INSERT OR REPLACE INTO " + name + "(k, v) VALUES(?1, ?2)") {}

    RawStatement insert_;
};

// (k INTEGER PRIMARY KEY, v BLOB); its scan's key column is an integer.
class RawIntTable : public RawDataTable {
  public:
    explicit RawIntTable(RawDatabase& db)
        : RawDataTable(db, db.createTable("(k INTEGER PRIMARY KEY, v BLOB)")) {}

    void insert(std::int64_t key, const void* data, std::size_t dataSize) {
        insert_.bindInt(1, key);
        insert_.bindBlob(2, data, dataSize);
        insert_.run();
    }
};

// (k BLOB PRIMARY KEY, v BLOB) WITHOUT ROWID.
class RawBlobTable : public RawDataTable {
  public:
    explicit RawBlobTable(RawDatabase& db)
        : RawBlobTable(db, db.createTable("(k BLOB PRIMARY KEY, v BLOB) WITHOUT ROWID")) {}

    void insert(const void* key, std::size_t keySize, const void* data, std::size_t dataSize) {
        insert_.bindBlob(1, key, keySize);
        insert_.bindBlob(2, data, dataSize);
        insert_.run();
    }

    // Point seek: when the key exists, copies up to `capacity` leading bytes
    // of its data into `buffer` and returns the data's full length;
    // otherwise returns -1 and copies nothing.
    std::int64_t seekData(const void* key, std::size_t keySize, void* buffer,
                          std::size_t capacity) {
        seek_.bindBlob(1, key, keySize);
        if (!seek_.step()) {
            return -1;
        }
        std::size_t size = seek_.bytes(0);
        if (size > 0) {
            std::memcpy(buffer, seek_.blob(0), size < capacity ? size : capacity);
        }
        seek_.reset();
        return static_cast<std::int64_t>(size);
    }

  private:
    RawBlobTable(RawDatabase& db, const std::string& name)
        : RawDataTable(db, name), seek_(db.handle(), "SELECT v FROM " + name + " WHERE k = ?1") {}

    RawStatement seek_;
};

// (k BLOB PRIMARY KEY) WITHOUT ROWID: key-only entries with composite keys
// (a group prefix followed by a payload).
class RawKeyTable : public RawTable {
  public:
    explicit RawKeyTable(RawDatabase& db)
        : RawKeyTable(db, db.createTable("(k BLOB PRIMARY KEY) WITHOUT ROWID")) {}

    void insert(const void* key, std::size_t keySize) {
        insert_.bindBlob(1, key, keySize);
        insert_.run();
    }

    // Walks every entry whose key begins with the prefix, in key order, and
    // calls visit(payload, payloadSize) with the bytes after the prefix.
    // Returns the number of entries walked.
    template <class Visit>
    std::size_t walkPrefix(const void* prefix, std::size_t prefixSize, Visit&& visit) {
        walk_.bindBlob(1, prefix, prefixSize);
        std::size_t walked = 0;
        while (walk_.step()) {
            const auto* key = static_cast<const unsigned char*>(walk_.blob(0));
            std::size_t keySize = walk_.bytes(0);
            if (keySize < prefixSize ||
                (prefixSize > 0 && std::memcmp(key, prefix, prefixSize) != 0)) {
                walk_.reset();
                break;
            }
            visit(key + prefixSize, keySize - prefixSize);
            ++walked;
        }
        return walked;
    }

  private:
    RawKeyTable(RawDatabase& db, const std::string& name)
        : RawTable(db, name, "k", "k"),
          insert_(db.handle(), "INSERT OR IGNORE INTO " + name + "(k) VALUES(?1)"),
          walk_(db.handle(), "SELECT k FROM " + name + " WHERE k >= ?1 ORDER BY k") {}

    RawStatement insert_;
    RawStatement walk_;
};

// (key BLOB PRIMARY KEY, count INTEGER) WITHOUT ROWID: how often each key was
// counted. Scan columns: 0 = key, 1 = count (an integer).
class RawCountTable : public RawTable {
  public:
    explicit RawCountTable(RawDatabase& db) : RawCountTable(db, db.createTable(kColumns)) {}

    // Counts the key once more: 1 when it was absent.
    void increment(const void* key, std::size_t keySize) {
        upsert_.bindBlob(1, key, keySize);
        upsert_.run();
    }

    // The whole table in key order: visit(key, keySize, count) for each row,
    // the key copied out first.
    template <class Visit>
    void walk(std::vector<unsigned char>& keyBuf, Visit&& visit) {
        for (RawScan& s = scan(); s.step();) {
            std::size_t keySize = s.bytes(0);
            keyBuf.resize(keySize);
            std::memcpy(keyBuf.data(), s.blob(0), keySize);
            visit(keyBuf.data(), keySize, static_cast<std::uint64_t>(s.integer(1)));
        }
    }

  private:
    static constexpr char kColumns[] = "(key BLOB PRIMARY KEY, count INTEGER) WITHOUT ROWID";

    RawCountTable(RawDatabase& db, const std::string& name)
        : RawTable(db, name, "key", "key, count"),
          upsert_(db.handle(), "INSERT INTO " + name +
                                   "(key, count) VALUES(?1, 1) "
                                   "ON CONFLICT(key) DO UPDATE SET count = count + 1") {}

    RawStatement upsert_;
};

// ---- The raw side of the paired workloads ----
// Each returns the chunk function that PairedRun::sides runs as the raw
// side: it does operations [begin, end) of the workload. What it is handed
// must outlive it.

// Inserts of the integer keys begin..end-1, entry i with Payload entry i.
inline auto rawIntInserts(RawIntTable& table, Payload& data) {
    return [&table, &data](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            table.insert(static_cast<std::int64_t>(i), data.forEntry(i), kDataSize);
        }
    };
}

// Inserts of keys[begin..end), entry i with Payload entry i.
inline auto rawBlobInserts(RawBlobTable& table, const std::vector<Key16>& keys, Payload& data) {
    return [&table, &keys, &data](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            table.insert(keys[i].data(), keys[i].size(), data.forEntry(i), kDataSize);
        }
    };
}

// Key-only inserts of keys[begin..end).
inline auto rawKeyInserts(RawKeyTable& table, const std::vector<Key16>& keys) {
    return [&table, &keys](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            table.insert(keys[i].data(), keys[i].size());
        }
    };
}

// Counts of keys[begin..end), each with one upsert.
inline auto rawCountDraws(RawCountTable& table, const std::vector<Key16>& keys) {
    return [&table, &keys](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            table.increment(keys[i].data(), keys[i].size());
        }
    };
}

// The next end - begin rows of an ordered scan, key and data copied into
// the buffers and tallied. Reset the scan after the last chunk.
inline auto rawScanRows(RawScan& scan, std::vector<unsigned char>& keyBuf,
                        std::vector<unsigned char>& dataBuf, Tally& tally) {
    return [&scan, &keyBuf, &dataBuf, &tally](std::size_t begin, std::size_t end) {
        scan.copyRows(end - begin, keyBuf, dataBuf,
                      [&tally](const unsigned char* key, std::size_t keySize,
                               const unsigned char* data) { tally.add(key, keySize, data); });
    };
}

// Seeks of keys[order[i]], i in [begin, end), the data read into `buffer`;
// an entry found with 8 bytes of data or more is tallied.
inline auto rawSeeks(RawBlobTable& table, const std::vector<Key16>& keys,
                     const std::vector<std::size_t>& order, std::vector<unsigned char>& buffer,
                     Tally& tally) {
    return [&table, &keys, &order, &buffer, &tally](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i) {
            const Key16& key = keys[order[i]];
            if (table.seekData(key.data(), key.size(), buffer.data(), buffer.size()) >= 8) {
                tally.add(key.data(), key.size(), buffer.data());
            }
        }
    };
}

}  // namespace kov::bench

#endif  // KOVPAGER_BENCH_RAW_SQLITE_H
