// The private SQLite's page cache, installed through SQLITE_CONFIG_PCACHE2.
//
// Why. The store's temporary database has a budget of 16384 pages (64 MiB
// of 4 KiB pages). SQLite's default cache recycles the least recently used
// unpinned page whatever it holds. Once a table is larger than the cache,
// a random seek or insert touches the root, a few interior pages and one
// leaf; the leaves are many and each is touched rarely, but there are so
// many of them that their stream pushes interior pages out as well, and a
// descent then misses on interior pages besides its leaf. Interior pages
// are few (one per hundred or more leaves for the store's keys), so
// keeping all of them costs a sliver of the budget and leaves each descent
// with at most one miss: its leaf.
//
// The policy. Within the budget SQLite asks for (xCachesize: the
// cache_size pragma), unpinned pages sit on one of two lists, each in
// order of last use. When a page is unpinned its content is current, and
// its B-tree page-type byte (offset 0; offset 100 on page 1, after the
// file header) says which list: 0x02 and 0x05 (interior index and table
// pages) go on the interior list; everything else (leaves 0x0a and 0x0d,
// overflow and freelist pages, anything unrecognised) on the other list.
// A new page takes the buffer of the least recently used page of the other
// list; only when that list is empty does it take the least recently used
// interior page.
//
// No limit on interior pages. A limit (say, interior pages at most 3/4 of
// the budget, so that leaves always keep a quarter) was measured and left
// out: it only ever binds when the interior levels outgrow the budget, and
// there it costs reads. With 300 pages of cache and 100 000 keys of 200
// bytes (some 310 interior pages), a limit of 3/4 gave 1.63 misses per
// random seek and 2.05 per random insert, none gave 1.55 and 2.02; with
// 300 000 keys of 16 bytes, 1.27 against 1.11 per seek. Leaves need no
// reserve: a descent uses its leaf once, and a page a cursor stands on, or
// one modified and not yet written, is pinned and on no list. The share is
// kept as a setting for measurements (TEST_setInteriorSharePercent). The
// figures before and after this cache are in bench/PAGE_CACHE.md.
//
// Dirty pages. SQLite keeps a modified page pinned until it is written to
// the file, and asks for a new page with createFlag 1 while it has modified
// pages. Then, like SQLite's own cache, this one refuses (SQLite writes one
// of its modified pages out and asks again with createFlag 2) when 9/10 of
// the budget is pinned, so that modified pages never crowd out every clean
// page; and also when it is at its budget and only interior pages could be
// recycled: writing a modified page out is then better than dropping a
// page that the next descent needs. With createFlag 2 it recycles whatever
// the order above gives, and when every page is pinned it makes a page past
// the budget (as SQLite's own cache does; the page is freed when unpinned
// while the cache is over its budget).
//
// Non-purgeable caches (in-memory databases: nothing behind them) keep
// every page until SQLite discards it: the budget does not apply to them.
//
// Memory. One allocation per page: the buffer, this cache's header and
// SQLite's extra bytes, as in SQLite's own cache, whose per-page header is
// not smaller than this one's. A recycled page keeps its allocation, so a
// miss past the budget allocates nothing. The hash table grows by doubling
// to four slots per page (kSlotsPerPage).
//
// Single-threaded (SQLITE_THREADSAFE=0, one connection used from one
// thread at a time): no locks.

#include "engine/page_cache.h"

#include <cassert>
#include <cstddef>
#include <cstring>

namespace kov::engine {

namespace {

// B-tree page types, the first byte of a page's B-tree header.
constexpr unsigned char kInteriorIndexPage = 0x02;
constexpr unsigned char kInteriorTablePage = 0x05;
// Page 1 starts with the 100-byte file header.
constexpr std::size_t kFileHeaderSize = 100;

constexpr unsigned kFirstHashSize = 256;
// Hash slots per cached page. Every lookup of a page that is not cached walks
// its whole chain, and each link is a page header in memory of its own (a
// cache miss of the processor): at four slots per page most chains are empty
// (measured: a lookup at one slot per page took most of the fetch's time).
constexpr unsigned kSlotsPerPage = 4;

// Where a page is: pinned (on no list), or on one of the two lists.
enum Place : unsigned char { kPinned = 0, kOnOther = 1, kOnInterior = 2 };

// One page, in the same allocation as its buffer: [Page][extra][buffer][tail].
// SQLite's handle on the page (`base`) comes first, so that the handle it
// gives back is the page itself. The headers a fetch reads (this one, then
// SQLite's in `extra`) lie right before the buffer's first line, which a
// search reads next: a seek past the levels the processor holds meets one
// run of lines per page instead of two places (with the headers after the
// buffer, W5's seeks took a tenth more time). The tail keeps a few bytes
// after the buffer addressable, as SQLite's own cache does (its header
// follows the buffer there): a cell parse near the end of a page may look a
// few bytes past it.
struct Page {
    sqlite3_pcache_page base;
    Page* hashNext;
    Page* lruPrev;  // towards the more recently used end (lists only)
    Page* lruNext;  // towards the less recently used end
    unsigned key;
    Place place;
};

constexpr std::size_t roundUp8(std::size_t n) { return (n + 7) & ~static_cast<std::size_t>(7); }
constexpr std::size_t kHeaderSize = roundUp8(sizeof(Page));
constexpr std::size_t kTailSize = 16;

// A list of unpinned pages in order of use: the anchor's lruNext is the
// most recently used page, its lruPrev the least recently used.
struct LruList {
    Page anchor;
    unsigned count;
};

struct Cache {
    int pageSize;
    int extraSize;
    bool purgeable;
    unsigned budget;   // pages, purgeable caches only
    unsigned pages;    // pinned and unpinned
    unsigned maxKey;   // no page has a larger key
    Page** hash;
    unsigned hashSize; // a power of two
    LruList other;
    LruList interior;
};

PageCacheCounters gCounters;
int gInteriorSharePercent = 100;
bool gInstalled = false;
bool gActive = false;

void listInit(LruList& list) {
    list.anchor.lruNext = list.anchor.lruPrev = &list.anchor;
    list.count = 0;
}

LruList& listOf(Cache* c, Place place) { return place == kOnInterior ? c->interior : c->other; }

void listPushFront(Cache* c, Page* p, Place place) {
    LruList& list = listOf(c, place);
    p->lruPrev = &list.anchor;
    p->lruNext = list.anchor.lruNext;
    list.anchor.lruNext->lruPrev = p;
    list.anchor.lruNext = p;
    ++list.count;
    p->place = place;
}

// Takes an unpinned page off its list: it is pinned afterwards.
void listRemove(Cache* c, Page* p) {
    LruList& list = listOf(c, p->place);
    p->lruPrev->lruNext = p->lruNext;
    p->lruNext->lruPrev = p->lruPrev;
    p->lruPrev = p->lruNext = nullptr;
    --list.count;
    p->place = kPinned;
}

Page* leastRecent(LruList& list) { return list.count == 0 ? nullptr : list.anchor.lruPrev; }

unsigned unpinned(const Cache* c) { return c->other.count + c->interior.count; }

Page* lookup(const Cache* c, unsigned key) {
    Page* p = c->hash[key & (c->hashSize - 1)];
    while (p != nullptr && p->key != key)
        p = p->hashNext;
    return p;
}

void hashInsert(Cache* c, Page* p) {
    Page** slot = &c->hash[p->key & (c->hashSize - 1)];
    p->hashNext = *slot;
    *slot = p;
}

void hashRemove(Cache* c, Page* p) {
    Page** link = &c->hash[p->key & (c->hashSize - 1)];
    while (*link != p)
        link = &(*link)->hashNext;
    *link = p->hashNext;
}

// Doubles the hash table; on failure the old one stays (longer chains, no
// harm).
void growHash(Cache* c) {
    unsigned size = c->hashSize == 0 ? kFirstHashSize : c->hashSize * 2;
    auto** table = static_cast<Page**>(sqlite3_malloc64(sizeof(Page*) * size));
    if (table == nullptr)
        return;
    std::memset(table, 0, sizeof(Page*) * size);
    for (unsigned i = 0; i < c->hashSize; ++i) {
        for (Page* p = c->hash[i]; p != nullptr;) {
            Page* next = p->hashNext;
            Page** slot = &table[p->key & (size - 1)];
            p->hashNext = *slot;
            *slot = p;
            p = next;
        }
    }
    sqlite3_free(c->hash);
    c->hash = table;
    c->hashSize = size;
}

// Removes a page from the cache and frees it, pinned or not.
void discard(Cache* c, Page* p) {
    if (p->place != kPinned)
        listRemove(c, p);
    hashRemove(c, p);
    --c->pages;
    sqlite3_free(p);  // the start of the page's one allocation
}

bool isInterior(const Page* p) {
    const auto* data = static_cast<const unsigned char*>(p->base.pBuf);
    unsigned char type = data[p->key == 1 ? kFileHeaderSize : 0];
    return type == kInteriorIndexPage || type == kInteriorTablePage;
}

// The page whose buffer the next new page takes, or null. Interior pages
// are chosen only past their share of the budget, or when `anyPage` and no
// other page is unpinned.
Page* victim(Cache* c, bool anyPage) {
    std::uint64_t share =
        static_cast<std::uint64_t>(c->budget) * static_cast<unsigned>(gInteriorSharePercent) / 100;
    if (c->interior.count > share)
        return leastRecent(c->interior);
    if (Page* p = leastRecent(c->other))
        return p;
    return anyPage ? leastRecent(c->interior) : nullptr;
}

// --- The methods ---

int cacheInit(void*) {
    gActive = true;
    return SQLITE_OK;
}

void cacheShutdown(void*) { gActive = false; }

sqlite3_pcache* cacheCreate(int pageSize, int extraSize, int purgeable) {
    auto* c = static_cast<Cache*>(sqlite3_malloc64(sizeof(Cache)));
    if (c == nullptr)
        return nullptr;
    std::memset(static_cast<void*>(c), 0, sizeof(Cache));
    c->pageSize = pageSize;
    c->extraSize = extraSize;
    c->purgeable = purgeable != 0;
    listInit(c->other);
    listInit(c->interior);
    growHash(c);
    if (c->hash == nullptr) {
        sqlite3_free(c);
        return nullptr;
    }
    return reinterpret_cast<sqlite3_pcache*>(c);
}

Cache* cacheOf(sqlite3_pcache* p) { return reinterpret_cast<Cache*>(p); }
Page* pageOf(sqlite3_pcache_page* p) { return reinterpret_cast<Page*>(p); }

void cacheCachesize(sqlite3_pcache* pc, int pages) {
    Cache* c = cacheOf(pc);
    if (!c->purgeable)
        return;
    c->budget = pages < 0 ? 0u : static_cast<unsigned>(pages);
    while (c->pages > c->budget) {
        Page* p = victim(c, true);
        if (p == nullptr)
            break;  // the rest is pinned: freed as it is unpinned
        discard(c, p);
    }
}

int cachePagecount(sqlite3_pcache* pc) { return static_cast<int>(cacheOf(pc)->pages); }

// A page for a key the cache does not hold (createFlag 1 or 2).
Page* makePage(Cache* c, unsigned key, int createFlag) {
    Page* p = nullptr;
    if (c->purgeable) {
        unsigned pinned = c->pages - unpinned(c);
        // createFlag 1 is SQLite asking whether a page comes cheaply while it
        // holds modified pages; a refusal makes it write one out first.
        if (createFlag == 1 && pinned >= static_cast<std::uint64_t>(c->budget) * 9 / 10)
            return nullptr;
        if (c->pages >= c->budget) {
            p = victim(c, createFlag == 2);
            if (p == nullptr && createFlag == 1)
                return nullptr;
        }
    }
    if (p != nullptr) {
        if (p->place == kOnInterior)
            ++gCounters.recycledInterior;
        else
            ++gCounters.recycledOther;
        listRemove(c, p);
        hashRemove(c, p);
        --c->pages;
    } else {
        const std::size_t extra = roundUp8(static_cast<std::size_t>(c->extraSize));
        const std::size_t size =
            kHeaderSize + extra + static_cast<std::size_t>(c->pageSize) + kTailSize;
        auto* start = static_cast<unsigned char*>(sqlite3_malloc64(size));
        if (start == nullptr)
            return nullptr;
        p = reinterpret_cast<Page*>(start);
        p->base.pExtra = start + kHeaderSize;
        p->base.pBuf = start + kHeaderSize + extra;
        auto* block = static_cast<unsigned char*>(p->base.pBuf);
        std::memset(block + c->pageSize, 0, kTailSize);
        // The bytes an unpin reads to tell an interior page start defined, for
        // a page that SQLite hands back before it has written them.
        block[0] = 0;
        if (c->pageSize > 100)
            block[100] = 0;
        if (c->purgeable && c->pages >= c->budget)
            ++gCounters.pastBudget;
    }
    if (c->pages >= c->hashSize / kSlotsPerPage)
        growHash(c);
    p->key = key;
    p->place = kPinned;
    p->lruPrev = p->lruNext = nullptr;
    // SQLite recognises a page it has not set up yet by the null pointer at
    // the start of the extra bytes; the whole area is cleared (it is small
    // next to the read that follows), so nothing of a recycled page's
    // previous owner is left in it.
    std::memset(p->base.pExtra, 0, static_cast<std::size_t>(c->extraSize));
    hashInsert(c, p);
    ++c->pages;
    if (key > c->maxKey)
        c->maxKey = key;
    ++gCounters.misses;
    return p;
}

sqlite3_pcache_page* cacheFetch(sqlite3_pcache* pc, unsigned key, int createFlag) {
    Cache* c = cacheOf(pc);
    Page* p = lookup(c, key);
    if (p != nullptr) {
        if (p->place != kPinned)
            listRemove(c, p);
        ++gCounters.hits;
        return &p->base;
    }
    if (createFlag == 0)
        return nullptr;
    p = makePage(c, key, createFlag);
    return p == nullptr ? nullptr : &p->base;
}

void cacheUnpin(sqlite3_pcache* pc, sqlite3_pcache_page* handle, int discardPage) {
    Cache* c = cacheOf(pc);
    Page* p = pageOf(handle);
    if (discardPage != 0 || (c->purgeable && c->pages > c->budget)) {
        discard(c, p);
        return;
    }
    // SQLite unpins a page of a non-purgeable cache only to discard it; were
    // it to do otherwise, the page stays as it is, held until discarded.
    if (!c->purgeable)
        return;
    listPushFront(c, p, isInterior(p) ? kOnInterior : kOnOther);
}

void cacheRekey(sqlite3_pcache* pc, sqlite3_pcache_page* handle, unsigned oldKey,
                unsigned newKey) {
    Cache* c = cacheOf(pc);
    Page* p = pageOf(handle);
    assert(p->key == oldKey);
    (void)oldKey;
    if (p->key == newKey)
        return;
    hashRemove(c, p);
    if (Page* previous = lookup(c, newKey))
        discard(c, previous);
    p->key = newKey;
    hashInsert(c, p);
    if (newKey > c->maxKey)
        c->maxKey = newKey;
}

// Discards every page whose key is `limit` or more, pinned ones included.
void cacheTruncate(sqlite3_pcache* pc, unsigned limit) {
    Cache* c = cacheOf(pc);
    if (c->pages == 0 || limit > c->maxKey)
        return;
    // Only the slots that keys limit..maxKey fall in, when they are fewer
    // than the table's.
    bool fewKeys = c->maxKey - limit < c->hashSize;
    unsigned first = fewKeys ? limit : 0;
    unsigned count = fewKeys ? c->maxKey - limit + 1 : c->hashSize;
    for (unsigned i = 0; i < count; ++i) {
        Page** link = &c->hash[(first + i) & (c->hashSize - 1)];
        while (*link != nullptr) {
            Page* p = *link;
            if (p->key >= limit) {
                *link = p->hashNext;
                p->hashNext = nullptr;
                if (p->place != kPinned)
                    listRemove(c, p);
                --c->pages;
                sqlite3_free(p);
            } else {
                link = &p->hashNext;
            }
        }
    }
    c->maxKey = limit == 0 ? 0 : limit - 1;
}

void cacheDestroy(sqlite3_pcache* pc) {
    Cache* c = cacheOf(pc);
    cacheTruncate(pc, 0);
    sqlite3_free(c->hash);
    sqlite3_free(c);
}

// Frees every unpinned page.
void cacheShrink(sqlite3_pcache* pc) {
    Cache* c = cacheOf(pc);
    while (Page* p = leastRecent(c->other))
        discard(c, p);
    while (Page* p = leastRecent(c->interior))
        discard(c, p);
}

const sqlite3_pcache_methods2 kMethods = {
    1,        // iVersion
    nullptr,  // pArg
    cacheInit,      cacheShutdown, cacheCreate,   cacheCachesize, cachePagecount,
    cacheFetch,     cacheUnpin,    cacheRekey,    cacheTruncate,  cacheDestroy,
    cacheShrink,
};

}  // namespace

bool installPageCache() {
    static bool tried = false;
    if (!tried) {
        tried = true;
        // SQLite copies the methods; it refuses (SQLITE_MISUSE) once it has
        // initialised, and then keeps its own cache.
        gInstalled = sqlite3_config(SQLITE_CONFIG_PCACHE2, &kMethods) == SQLITE_OK;
    }
    return gInstalled;
}

bool pageCacheActive() { return gActive; }

const sqlite3_pcache_methods2& pageCacheMethods() { return kMethods; }

PageCacheCounters pageCacheCounters() { return gCounters; }

void resetPageCacheCounters() { gCounters = PageCacheCounters{}; }

int TEST_setInteriorSharePercent(int percent) {
    int previous = gInteriorSharePercent;
    gInteriorSharePercent = percent < 0 ? 0 : percent > 100 ? 100 : percent;
    return previous;
}

}  // namespace kov::engine
