// The private SQLite's page cache: a replacement for SQLite's default one
// that keeps interior B-tree pages in memory in preference to leaves (the
// policy and its reasons are at the top of engine/page_cache.cpp).
//
// installPageCache() hands the cache to the private SQLite. SQLite takes a
// page cache only before it initialises, so the call must come before the
// first connection is opened (sqlite3BtreeOpen makes it, before its
// sqlite3_open_v2). Later calls do nothing; a call that comes too late
// leaves SQLite's own cache in place, which is slower past the cache but
// behaves the same.
//
// Single-threaded, like the private SQLite (SQLITE_THREADSAFE=0): nothing
// here locks.
#ifndef KOVPAGER_ENGINE_PAGE_CACHE_H
#define KOVPAGER_ENGINE_PAGE_CACHE_H

#include <cstdint>

#include "engine/private_sqlite3.h"

namespace kov::engine {

// Installs the cache (once per process). True when it is the cache SQLite
// uses, now or from its initialisation on.
bool installPageCache();

// True between SQLite's initialisation with this cache and its shutdown.
bool pageCacheActive();

// The methods as SQLite is given them; the tests drive them directly.
const sqlite3_pcache_methods2& pageCacheMethods();

// What every cache has done since the process started (or since the last
// resetPageCacheCounters). A miss is a fetch that made a page for a key
// the cache did not hold: SQLite then reads it from the file, or fills a
// new page itself.
struct PageCacheCounters {
    std::uint64_t hits = 0;
    std::uint64_t misses = 0;
    std::uint64_t recycledOther = 0;     // buffers taken from a leaf or other page
    std::uint64_t recycledInterior = 0;  // buffers taken from an interior page
    std::uint64_t pastBudget = 0;        // pages made while every page was pinned
};
PageCacheCounters pageCacheCounters();
void resetPageCacheCounters();

// The share of a purgeable cache's budget, in percent, that unpinned
// interior pages may hold before the least recently used of them is
// recycled ahead of leaves: 100 (no limit) unless changed. For
// measurements and tests; returns the previous value.
int TEST_setInteriorSharePercent(int percent);

}  // namespace kov::engine

#endif  // KOVPAGER_ENGINE_PAGE_CACHE_H
