// The store program: the model, the host objects it drives and every action (see
// store_program.h for what it does and checks).
#include "store_program.h"

#include <cstdio>
#include <cstring>
#include <iterator>
#include <map>
#include <new>
#include <set>
#include <sstream>
#include <string_view>
#include <utility>

#include "engine/btree.h"
#include "engine/sorted_load.h"
#include "engine_test_util.h"
#include "kov_test_access.h"

namespace kovtest {

class StoreProgram::Impl {
  public:
    Impl(ChoiceSource& choices, ProgramOptions options)
        : in_(choices), opt_(std::move(options)), loads_(opt_.loads) {}

    ~Impl() {
        clearHost();
        disposeCopies();
    }

    Impl(const Impl&) = delete;
    Impl& operator=(const Impl&) = delete;

    // Starts from an empty registry and a closed engine, runs up to `steps` steps (or until the
    // choices run out), then destroys every host object (cursors first) and empties the registry.
    void run(int steps) {
        begin();
        for (step_ = 0; step_ < steps && !in_.exhausted() && !stopped_; ++step_)
            oneStepChecked();
        end();
    }

    // The same in pieces, for callers that arm faults between steps.
    void begin() {
        clearHost();
        disposeCopies();
        unmodelled_ = false;
        faultSinceReset_ = false;
        mergesGoOn_ = false;
        KovPager::instance()->reset();
        KovTestAccess::teardown();
        engineOpen_ = false;
        restartLoads();
        db_.clear();
        refused_.clear();
        slots_.clear();
        step_ = 0;
        dirty_ = false;
        degraded_ = false;
        writesRefused_ = false;
    }
    void step() {
        if (!stopped_)
            oneStepChecked();
        ++step_;
    }
    void end() {
        if (dirty_ && !armed() && !unmodelled_)
            resync();
        harvestLoadStats();
        clearHost();
        disposeCopies();
        KovTestAccess::teardown();
        engineOpen_ = false;
    }

    std::uint64_t steps() const { return static_cast<std::uint64_t>(step_); }
    std::uint64_t operations() const { return operations_; }
    // Answers that differ from the model.
    std::uint64_t mismatches() const { return mismatches_; }
    // True once a fault ended the engine's write transaction: it refuses writes until a reset
    // opens a fresh one.
    bool writesRefused() const { return writesRefused_; }
    const std::vector<std::string>& mismatchTexts() const { return texts_; }
    std::string firstMismatch() const { return texts_.empty() ? std::string() : texts_.front(); }
    const FaultReport& faultReport() const { return report_; }
    const LoadReport& loadReport() {
        loadReport_.engine = loadTotals_;
        if (engineOpen_ && openEngine() != nullptr)
            addLoads(loadReport_.engine, kov::engine::TEST_loadStats(openEngine()));
        return loadReport_;
    }
    bool stopped() const { return stopped_; }
    // Bytes of data the model holds (what the store should hold).
    std::uint64_t modelBytes() const {
        std::uint64_t n = 0;
        for (const auto& [root, t] : db_) {
            (void)root;
            for (const auto& e : t.bytes)
                n += e.first.size() + e.second.size();
            for (const auto& e : t.ints)
                n += 8 + e.second.size();
        }
        return n;
    }
    bool dirty() const { return dirty_; }
    // The options, for callers that change the mix between steps (hooks excepted).
    ProgramOptions& options() { return opt_; }
    // True after a resync found a damaged table: nothing is checked until the next reset.
    bool degraded() const { return degraded_; }
    // A reset made by the caller, as the host would (between steps).
    void forceReset() {
        last_ = "reset";
        reset();
    }

  private:
    // One insert the engine gathered and has not merged: in run `batch` when the table has
    // written more than `batch` runs, else in its buffer.
    struct Gathered {
        std::int64_t ik = 0;
        std::string bk;
        std::string data;
        std::uint32_t batch = 0;
    };
    // What a merge did to one key: what it held before (if anything), what it holds after.
    struct MergeChange {
        bool hadOld = false;
        std::string old;
        std::string now;
    };
    // A table's load as the engine keeps it (engine/btree.cpp).
    struct LoadModel {
        std::uint32_t insertsSinceRead = 0;
        bool pending = false;  // the engine holds a load for the table (maybe an empty one)
        std::uint32_t runs = 0;
        std::size_t bufferBytes = 0;  // the footprints of the entries in the buffer
        std::vector<Gathered> entries;  // not merged, oldest first
        bool uncertain = false;  // see LoadReport::ambiguousSpills
    };
    struct ModelTable {
        bool intKey = false;
        bool hasData = true;
        bool broken = false;
        // What every read answers: what was merged with what was gathered over it.
        std::map<std::string, std::string> bytes;
        std::map<std::int64_t, std::string> ints;
        // What the table's B-tree holds.
        std::map<std::string, std::string> mergedBytes;
        std::map<std::int64_t, std::string> mergedInts;
        LoadModel load;
        bool empty() const { return intKey ? ints.empty() : bytes.empty(); }
        std::size_t size() const { return intKey ? ints.size() : bytes.size(); }
    };
    enum class Handle { None, Open, Inert };
    struct ModelSlot {
        bool live = true;
        std::uint32_t root = 0;
        std::uint32_t flags = 0;
        Handle handle = Handle::None;
        bool writer = false;
        bool on = false;
        std::int64_t ik = 0;
        std::string bk;
    };
    struct HostTable {
        std::unique_ptr<KovBtree> obj;
        std::uint32_t root = 0;
        std::uint32_t flags = 0;
        int generation = 0;
        int cursors = 0;  // host cursors made on it and still alive
    };
    struct HostCursor {
        std::unique_ptr<KovBtreeCursor> obj;
        std::size_t slot = 0;
        int generation = 0;
        HostTable* table = nullptr;  // null once the table is destroyed
    };

    static std::uint32_t flagsOfKind(std::int32_t kind) {
        if (kind == 0)
            return 0;
        if (kind == 1)
            return 5;
        return 2;
    }

    void clearHost() {
        cursors_.clear();
        tables_.clear();
    }

    // A copy of the pager lives in storage of the program's own: the destructor of a copy is
    // private, KovTestAccess runs it without touching the engine the copy shares.
    struct PagerCopy {
        alignas(KovPager) unsigned char storage[sizeof(KovPager)];
        KovPager* pager = nullptr;
    };
    void disposeCopies() {
        for (auto& c : copies_)
            KovTestAccess::disposeCopy(c->pager);
        copies_.clear();
    }

    // Takes a copy, assigns one back or the pager to one, resets through one, assigns the pager
    // to itself. What the model cannot follow stops it for the rest of the run.
    void pagerAction() {
        const int a = pick(6);
        if (a == 0 || copies_.empty()) {
            if (copies_.size() >= 3)
                return;
            last_ = "copy the pager";
            auto c = std::make_unique<PagerCopy>();
            c->pager = new (c->storage) KovPager(*KovPager::instance());
            copies_.push_back(std::move(c));
            return;
        }
        KovPager& copy = *copies_[static_cast<std::size_t>(pick(static_cast<int>(copies_.size())))]
                              ->pager;
        if (a == 1 || a == 2) {
            last_ = "assign a copy back";
            *KovPager::instance() = copy;
            leaveTheModel();
        } else if (a == 3) {
            last_ = "reset through a copy";
            harvestLoadStats();
            copy.reset();
            leaveTheModel();
        } else if (a == 4) {
            last_ = "assign the pager to a copy";
            copy = *KovPager::instance();
        } else {
            last_ = "assign the pager to itself";
            KovPager* pager = KovPager::instance();
            *pager = *pager;
        }
    }
    void leaveTheModel() {
        unmodelled_ = true;
        degraded_ = true;
    }

    bool armed() const { return opt_.faultsArmed && opt_.faultsArmed(); }
    std::uint64_t events() const { return opt_.faultEvents ? opt_.faultEvents() : 0; }

    // ---- checking ----------------------------------------------------------------------------

    std::string where() const {
        std::ostringstream os;
        os << "step " << step_ << " (" << last_ << ")";
        return os.str();
    }
    void mismatch(const std::string& what) { pending_.push_back(where() + ": " + what); }
    template <typename A, typename B>
    void expectEq(const A& got, const B& expected, const char* what) {
        if (!(got == expected)) {
            std::ostringstream os;
            os << what << ": store " << got << ", model " << expected;
            mismatch(os.str());
        }
    }
    void expectTrue(bool ok, const std::string& what) {
        if (!ok)
            mismatch(what);
    }

    void oneStepChecked() {
        // A fault disarmed since the last step: take the engine's state before going on.
        if (dirty_ && !armed() && !unmodelled_)
            resync();
        const std::uint64_t before = events();
        const bool gatheredBefore = engineOpen_ && anyPendingEntries();
        pending_.clear();
        unchecked_ = false;
        lastInsertRoot_ = 0;
        lastSlot_ = -1;
        stepWork_.clear();
        stepMerges_.clear();
        oneStep();
        ++operations_;
        const bool faulted = events() != before;
        if (opt_.trace) {
            std::fprintf(stderr, "step %d%s%s: %s (cursor slot %lld)\n", step_,
                         faulted ? " FAULTED" : "", dirty_ ? " dirty" : "", last_.c_str(),
                         static_cast<long long>(lastSlot_));
        }
        if (faulted) {
            faultSinceReset_ = true;
            if (engineOpen_ && kov::engine::sqlite3BtreeIsOpen(KovTestAccess::engine()) &&
                kov::engine::sqlite3BtreeTxnState(KovTestAccess::engine()) !=
                    kov::engine::SQLITE_TXN_WRITE) {
                // A refusal for room or for the file changed nothing: what the tables gathered
                // is still merged at their next read.
                if (!writesRefused_)
                    mergesGoOn_ =
                        kov::engine::sqlite3BtreeFailureWasRefusal(KovTestAccess::engine());
                writesRefused_ = true;
            }
            if (lastInsertRoot_ != 0)
                refused_.push_back({lastInsertRoot_, lastInsertKey_, lastHadOld_, lastOld_});
            ++report_.faultedSteps;
            report_.faultedWithGathered += gatheredBefore ? 1 : 0;
            if (report_.faultedActions.size() < 8) {
                report_.faultedActions.push_back(last_);
                report_.faultedLoadWork.push_back(
                    stepWork_.empty() ? std::string() : stepWork_.substr(1));
            }
            for (auto& [root, changes] : stepMerges_) {
                std::map<std::string, MergeChange>& kept = faultMerges_[root];
                for (auto& [key, change] : changes) {
                    auto it = kept.find(key);
                    if (it == kept.end())
                        kept.emplace(key, change);
                    else
                        it->second.now = change.now;
                }
            }
            dirty_ = true;
        }
        if (!faulted && !dirty_ && !degraded_) {
            check();
            checkLoadStats();
            if (!unchecked_)
                commitPending();
        }
        pending_.clear();
    }
    void commitPending() {
        for (auto& text : pending_) {
            ++mismatches_;
            if (texts_.size() < 20)
                texts_.push_back(text);
        }
    }

    // ---- choices -----------------------------------------------------------------------------

    int pick(int n) { return static_cast<int>(in_.pick(static_cast<std::uint32_t>(n))); }
    bool chance(int percent) { return pick(100) < percent; }

    std::int64_t randomInt() {
        if (opt_.wideKeys) {
            std::uint64_t hi = in_.pick(0x10000u);
            std::uint64_t lo = in_.pick(0x10000u);
            std::uint64_t mid = in_.pick(0x10000u);
            return static_cast<std::int64_t>((hi << 48) | (mid << 24) | lo);
        }
        switch (pick(10)) {
            case 0:
                return INT64_MIN + pick(3);
            case 1:
                return INT64_MAX - pick(3);
            default:
                return pick(41) - 20;
        }
    }
    std::string randomBytes() {
        static const char alphabet[] = {'a', 'b', 'c', '\0', '\xff'};
        std::string s;
        if (opt_.wideKeys) {
            int len = 8 + pick(16);
            for (int i = 0; i < len; ++i)
                s.push_back(static_cast<char>(pick(256)));
            return s;
        }
        int len = chance(10) ? 16 + pick(30) : pick(5);
        for (int i = 0; i < len; ++i)
            s.push_back(alphabet[pick(5)]);
        return s;
    }
    std::string randomData() {
        std::uint32_t len;
        if (chance(opt_.bigPercent))
            len = opt_.bigMin + in_.pick(opt_.bigMax - opt_.bigMin + 1);
        else
            len = static_cast<std::uint32_t>(pick(30));
        // The bytes come from a small generator seeded by one choice: a big record costs the
        // choice source two bytes, not thousands.
        std::uint32_t x = in_.pick(0x10000u) * 2654435761u + 1u;
        std::string s(len, '\0');
        for (auto& ch : s) {
            x = x * 1103515245u + 12345u;
            ch = static_cast<char>(x >> 24);
        }
        return s;
    }

    // ---- model helpers -----------------------------------------------------------------------

    ModelTable* tableAt(std::uint32_t root) {
        auto it = db_.find(root);
        return it == db_.end() ? nullptr : &it->second;
    }
    ModelTable* tableOf(const ModelSlot& s) {
        return engineOpen_ && s.handle == Handle::Open ? tableAt(s.root) : nullptr;
    }
    bool anyOpen() const {
        for (const auto& s : slots_) {
            if (s.live && s.handle == Handle::Open)
                return true;
        }
        return false;
    }
    bool readerOn(std::uint32_t root) const {
        for (const auto& s : slots_) {
            if (s.live && s.handle == Handle::Open && !s.writer && s.root == root)
                return true;
        }
        return false;
    }
    // Answers about a broken table are not checked.
    void noteBroken(const ModelSlot& s) {
        ModelTable* t = tableOf(s);
        if (t != nullptr && t->broken)
            unchecked_ = true;
    }

    // Engine move-to on a model table: the smallest entry not below the key, else the largest.
    template <typename Map, typename Key>
    static int moveIn(const Map& m, const Key& k, Key& at, bool& on) {
        auto it = m.lower_bound(k);
        if (it != m.end()) {
            on = true;
            at = it->first;
            return it->first == k ? 0 : 1;
        }
        on = !m.empty();
        if (on)
            at = m.rbegin()->first;
        return -1;
    }
    static int moveInt(ModelSlot& s, ModelTable& t, std::int64_t k) {
        return moveIn(t.ints, k, s.ik, s.on);
    }
    static int moveBytes(ModelSlot& s, ModelTable& t, const std::string& k) {
        return moveIn(t.bytes, k, s.bk, s.on);
    }

    std::int64_t keySizeOf(ModelSlot& s) {
        ModelTable* t = tableOf(s);
        if (t == nullptr || !s.on)
            return 0;
        return t->intKey ? s.ik : static_cast<std::int64_t>(s.bk.size());
    }
    std::string dataOfSlot(ModelSlot& s) {
        ModelTable* t = tableOf(s);
        if (t == nullptr || !s.on || !t->hasData)
            return {};
        if (t->intKey) {
            auto it = t->ints.find(s.ik);
            return it == t->ints.end() ? std::string() : it->second;
        }
        auto it = t->bytes.find(s.bk);
        return it == t->bytes.end() ? std::string() : it->second;
    }
    void leaveTable(std::uint32_t root) {
        for (auto& other : slots_) {
            if (other.live && other.handle == Handle::Open && other.root == root)
                other.on = false;
        }
    }

    // ---- actions -----------------------------------------------------------------------------

    void createTable() {
        std::int32_t kind;
        if (opt_.oddInputs && chance(30)) {
            static const std::int32_t odd[] = {3, -1, 7, INT32_MIN, INT32_MAX, 255};
            kind = odd[pick(6)];
        } else {
            kind = pick(3);
        }
        last_ = "create table kind " + std::to_string(kind);
        const bool opening = !engineOpen_;
        if (opening) {
            engineOpen_ = true;
            restartLoads();
            db_.clear();
        } else if (!writesRefused_ && anyPendingEntries()) {
            ++loadReport_.createdWithPending;
        }
        std::vector<std::string> saved(slots_.size());
        std::vector<bool> savedKnown(slots_.size(), true);
        for (std::size_t i = 0; i < slots_.size(); ++i) {
            ModelSlot& s = slots_[i];
            if (!s.live)
                continue;
            ModelTable* t = tableOf(s);
            if (t != nullptr && t->broken)
                savedKnown[i] = false;
            std::int64_t size = keySizeOf(s);
            if (s.flags & 1) {
                saved[i].assign(8, '\0');
                std::memcpy(&saved[i][0], &size, 8);
            } else if (t != nullptr && s.on && !t->intKey) {
                saved[i] = s.bk;
            } else {
                saved[i].clear();
            }
            s.handle = Handle::None;
        }
        auto host = std::make_unique<HostTable>();
        host->obj = std::make_unique<KovBtree>(static_cast<KovBtree::TableType>(kind));
        if (opening && opt_.onEngineOpened)
            opt_.onEngineOpened();
        host->root = KovTestAccess::rootPage(*host->obj);
        host->flags = flagsOfKind(kind);
        host->generation = generation_;
        bool degraded = anyBroken();
        if (writesRefused_ && !opening) {
            // The engine refuses every table creation: the table keeps root page 0, on which no
            // cursor opens.
            expectEq(host->root, 0u, "root page of a table made while writes are refused");
        } else if (host->root == 0) {
            // The engine refused the table: only a damaged engine does.
            expectTrue(degraded, "table creation refused");
        } else {
            ModelTable* old = tableAt(host->root);
            if (old != nullptr) {
                expectTrue(degraded, "new table on a live table's root page");
                db_.erase(host->root);
            }
            ModelTable& t = db_[host->root];
            t.intKey = (host->flags & 1) != 0;
            t.hasData = host->flags != 2;
            t.broken = old != nullptr;
        }
        tables_.push_back(std::move(host));
        for (std::size_t i = 0; i < slots_.size(); ++i) {
            ModelSlot& s = slots_[i];
            if (!s.live)
                continue;
            s.on = false;
            ModelTable* on = tableAt(s.root);
            if (on == nullptr)
                continue;  // no table has that root: the reopen is refused
            s.handle = Handle::Open;
            s.writer = true;
            if (on->broken || !savedKnown[i]) {
                adoptPosition(i);
                continue;
            }
            if (s.flags & 1) {
                std::int64_t k = 0;
                std::memcpy(&k, saved[i].data(), 8);
                if (on->intKey)
                    moveInt(s, *on, k);
            } else if (on->intKey) {
                moveInt(s, *on, static_cast<std::int64_t>(saved[i].size()));
            } else {
                moveBytes(s, *on, saved[i]);
            }
        }
        // Every reopened cursor searched its saved key: a read of its table (a saved integer key
        // is refused by a byte-string table before any search).
        for (const ModelSlot& s : slots_) {
            if (!s.live || s.handle != Handle::Open)
                continue;
            ModelTable* on = tableAt(s.root);
            if (on != nullptr && ((s.flags & 1) == 0 || on->intKey))
                loadRead(s.root);
        }
        if (degraded)
            adoptHandles();
    }

    void destroyTable() {
        if (tables_.empty())
            return;
        std::vector<std::size_t> candidates;
        for (std::size_t i = 0; i < tables_.size(); ++i) {
            if (!opt_.cursorsBeforeTables || tables_[i]->cursors == 0)
                candidates.push_back(i);
        }
        if (candidates.empty())
            return;
        std::size_t i =
            candidates[static_cast<std::size_t>(pick(static_cast<int>(candidates.size())))];
        last_ = "destroy table root " + std::to_string(tables_[i]->root);
        std::uint32_t root = tables_[i]->root;
        for (auto& c : cursors_) {
            if (c->table == tables_[i].get())
                c->table = nullptr;
        }
        tables_.erase(tables_.begin() + static_cast<std::ptrdiff_t>(i));
        // Refused while a cursor is open, and while the engine refuses writes.
        if (engineOpen_ && !anyOpen() && !writesRefused_ && root != 0) {
            ModelTable* t = tableAt(root);
            if (t != nullptr && pendingEntries(*t))
                ++loadReport_.destroyedWithPending;
            db_.erase(root);
        }
    }

    void openCursor() {
        std::vector<HostTable*> usable;
        for (auto& t : tables_) {
            if (t->generation == generation_)
                usable.push_back(t.get());
        }
        if (usable.empty())
            return;
        HostTable* t = usable[static_cast<std::size_t>(pick(static_cast<int>(usable.size())))];
        bool write = !chance(opt_.readerPercent);
        last_ = std::string("open ") + (write ? "writer" : "reader") + " on root " +
                std::to_string(t->root);
        ModelSlot s;
        s.root = t->root;
        s.flags = t->flags;
        s.writer = write;
        if (engineOpen_ && tableAt(t->root) != nullptr && !(write && readerOn(t->root)))
            s.handle = Handle::Open;
        auto c = std::make_unique<HostCursor>();
        c->obj = std::make_unique<KovBtreeCursor>(*t->obj, write);
        c->slot = slots_.size();
        c->generation = generation_;
        c->table = t;
        ++t->cursors;
        expectEq(KovTestAccess::slotIndex(*c->obj), static_cast<std::uint64_t>(slots_.size()),
                 "slot index");
        slots_.push_back(s);
        cursors_.push_back(std::move(c));
        if (!write && engineOpen_)
            loadRead(t->root);  // a read cursor: what the table gathered goes in first
        if (anyBroken())
            adoptHandles();
    }

    void destroyCursor() {
        if (cursors_.empty())
            return;
        std::size_t i = static_cast<std::size_t>(pick(static_cast<int>(cursors_.size())));
        last_ = "destroy cursor slot " + std::to_string(cursors_[i]->slot);
        std::size_t slot = cursors_[i]->slot;
        if (cursors_[i]->table != nullptr)
            --cursors_[i]->table->cursors;
        cursors_.erase(cursors_.begin() + static_cast<std::ptrdiff_t>(i));
        if (!engineOpen_)
            return;  // the slot stays as it is
        slots_[slot].live = false;
        slots_[slot].handle = Handle::None;
        slots_[slot].on = false;
        while (!slots_.empty() && !slots_.back().live)
            slots_.pop_back();
    }

    void reset() {
        last_ = "reset";
        if (engineOpen_ && !writesRefused_ && anyPendingEntries())
            ++loadReport_.resetsWithPending;
        harvestLoadStats();
        KovPager::instance()->reset();
        engineOpen_ = false;
        restartLoads();
        db_.clear();
        refused_.clear();  // of tables that are gone
        ++generation_;
        for (auto& s : slots_) {
            if (s.handle == Handle::Open)
                s.handle = Handle::Inert;
            s.on = false;
        }
        writesRefused_ = false;
        mergesGoOn_ = false;
        faultSinceReset_ = false;
        if (degraded_ && !unmodelled_) {
            // The handles of a damaged engine's slots were not followed; a fresh engine starts
            // from what the registry holds.
            adoptHandles();
            degraded_ = false;
        }
    }

    HostCursor* someCursor() {
        std::vector<HostCursor*> usable;
        for (auto& c : cursors_) {
            if (c->generation == generation_)
                usable.push_back(c.get());
        }
        if (usable.empty())
            return nullptr;
        return usable[static_cast<std::size_t>(pick(static_cast<int>(usable.size())))];
    }
    bool intKeyed(const HostCursor& c) {
        const ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        return t != nullptr ? t->intKey : (s.flags & 1) != 0;
    }

    void insert(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        bool allowed =
            t != nullptr && s.writer && !readerOn(s.root) && !t->broken && !writesRefused_;
        // 0: integer form, 1: key-only form, 2: key-and-data form.
        int form;
        if (opt_.oddInputs && chance(10))
            form = pick(3);
        else if (intKeyed(c))
            form = 0;
        else if ((s.flags == 2 || (t != nullptr && !t->hasData)) && chance(80))
            form = 1;
        else
            form = 2;
        bool changed = false;
        std::string lastKey;  // the entry's key as the model holds it (8 bytes for integers)
        if (form == 0) {
            std::int64_t k = randomInt();
            std::string d = randomData();
            last_ = "insert int " + std::to_string(k);
            c.obj->insert(k, d.data(), d.size());
            if (allowed && t->intKey) {
                noteReplaced(*t, k, std::string());
                t->ints[k] = t->hasData ? d : "";
                changed = true;
                lastKey = intKeyText(k);
                loadInsert(s.root, *t, k, std::string(), t->ints[k]);
            }
            // A byte-string table refuses an integer key: nothing changes.
        } else if (form == 1) {
            std::string k = randomBytes();
            last_ = "insert key-only, " + std::to_string(k.size()) + " bytes";
            c.obj->insert(k.data(), k.size());
            if (allowed) {
                noteReplaced(*t, static_cast<std::int64_t>(k.size()), k);
                if (t->intKey)
                    t->ints[static_cast<std::int64_t>(k.size())] = "";
                else
                    t->bytes[k] = "";
                changed = true;
                lastKey = t->intKey ? intKeyText(static_cast<std::int64_t>(k.size())) : k;
                loadInsert(s.root, *t, static_cast<std::int64_t>(k.size()), k, std::string());
            }
        } else {
            std::string k = randomBytes();
            std::string d = randomData();
            last_ = "insert bytes, " + std::to_string(k.size()) + " + " + std::to_string(d.size()) +
                    " bytes";
            c.obj->insert(k.data(), k.size(), d.data(), d.size());
            if (allowed) {
                noteReplaced(*t, static_cast<std::int64_t>(k.size()), k);
                if (t->intKey)
                    t->ints[static_cast<std::int64_t>(k.size())] = t->hasData ? d : "";
                else
                    t->bytes[k] = t->hasData ? d : "";
                changed = true;
                lastKey = t->intKey ? intKeyText(static_cast<std::int64_t>(k.size())) : k;
                loadInsert(s.root, *t, static_cast<std::int64_t>(k.size()), k,
                           t->hasData ? d : std::string());
            }
        }
        if (changed) {
            leaveTable(s.root);
            lastInsertRoot_ = s.root;
            lastInsertKey_ = lastKey;
        }
    }

    // What the insert about to be modelled replaces, in case a fault refuses it.
    void noteReplaced(const ModelTable& t, std::int64_t ik, const std::string& bk) {
        lastHadOld_ = false;
        lastOld_.clear();
        if (t.intKey) {
            auto it = t.ints.find(ik);
            if (it != t.ints.end()) {
                lastHadOld_ = true;
                lastOld_ = it->second;
            }
        } else {
            auto it = t.bytes.find(bk);
            if (it != t.bytes.end()) {
                lastHadOld_ = true;
                lastOld_ = it->second;
            }
        }
    }

    void seek(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        bool intForm = intKeyed(c);
        if (opt_.oddInputs && chance(10))
            intForm = !intForm;
        int expected = -1;
        int got = 0;
        if (intForm) {
            std::int64_t k = randomInt();
            last_ = "seek int " + std::to_string(k);
            got = c.obj->seek(k);
            if (t != nullptr && t->intKey) {
                loadRead(s.root);
                expected = moveInt(s, *t, k);
            }
            // A byte-string table refuses the integer form: the cursor stays where it was.
        } else {
            std::string k = randomBytes();
            last_ = "seek bytes, " + std::to_string(k.size()) + " bytes";
            got = c.obj->seek(k.data(), k.size());
            if (t != nullptr)
                loadRead(s.root);
            if (t != nullptr && t->intKey)
                expected = moveInt(s, *t, static_cast<std::int64_t>(k.size()));
            else if (t != nullptr)
                expected = moveBytes(s, *t, k);
        }
        if (t == nullptr)
            s.on = false;
        expectEq(got < 0, expected < 0, "seek below");
        expectEq(got == 0, expected == 0, "seek equal");
    }

    void move(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        int which = pick(4);
        static const char* names[] = {"first", "last", "next", "previous"};
        last_ = names[which];
        bool got = false;
        switch (which) {
            case 0:
                got = c.obj->first();
                break;
            case 1:
                got = c.obj->last();
                break;
            case 2:
                got = c.obj->next();
                break;
            default:
                got = c.obj->previous();
                break;
        }
        bool expected = false;
        if (t != nullptr && which < 2)
            loadRead(s.root);  // First and Last
        if (t != nullptr) {
            if (t->intKey)
                expected = stepIn(t->ints, s.ik, s.on, which);
            else
                expected = stepIn(t->bytes, s.bk, s.on, which);
        }
        s.on = expected;
        expectEq(got, expected, names[which]);
    }
    template <typename Map, typename Key>
    static bool stepIn(Map& m, Key& at, bool on, int which) {
        if (which == 0 && !m.empty()) {
            at = m.begin()->first;
            return true;
        }
        if (which == 1 && !m.empty()) {
            at = m.rbegin()->first;
            return true;
        }
        if (which == 2 && on) {
            auto it = m.upper_bound(at);
            if (it != m.end()) {
                at = it->first;
                return true;
            }
        }
        if (which == 3 && on) {
            auto it = m.lower_bound(at);
            if (it != m.begin()) {
                at = std::prev(it)->first;
                return true;
            }
        }
        return false;
    }

    void read(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        last_ = "read";
        const std::string data = dataOfSlot(s);
        expectEq(c.obj->dataSize(), static_cast<std::int64_t>(data.size()), "dataSize");
        std::string buf(data.size() + 1, '#');
        c.obj->data(&buf[0], data.size());
        expectTrue(buf == data + "#", "data");
        buf.assign(data.size() + 1, '#');
        c.obj->data(&buf[0], data.size() + 1);  // one byte too many: nothing
        expectTrue(buf == std::string(data.size() + 1, '#'), "data past the end");
        // The same bytes in place: the data, and the key of a byte-string entry (none for an
        // integer key, and none on no entry).
        expectTrue(c.obj->dataView() == data, "data view");
        const bool byteKeyed = t != nullptr && !t->intKey && s.on;
        expectTrue(c.obj->keyView() == (byteKeyed ? std::string_view(s.bk) : std::string_view()),
                   "key view");
        if (t != nullptr && !t->intKey && s.on) {
            std::string whole = s.bk + data;
            std::size_t n = static_cast<std::size_t>(pick(static_cast<int>(whole.size()) + 2));
            std::string kb(n, '#');
            KovTestAccess::key(*c.obj, &kb[0], n);
            expectTrue(kb == (n <= whole.size() ? whole.substr(0, n) : std::string(n, '#')),
                       "key bytes");
        }
    }

    void indexSeek(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        if (intKeyed(c) && !opt_.oddInputs)
            return;
        std::string k = randomBytes().substr(0, static_cast<std::size_t>(pick(3)));
        last_ = "indexKeySeek " + std::to_string(k.size()) + " bytes";
        bool got = c.obj->indexKeySeek(k.data(), k.size());
        bool expected = false;
        if (t != nullptr)
            loadRead(s.root);
        if (t != nullptr && t->intKey) {
            // An integer table takes the length as the key; below every key, the cursor steps
            // off the end.
            expected = moveInt(s, *t, static_cast<std::int64_t>(k.size())) >= 0;
        } else if (t != nullptr) {
            auto it = t->bytes.lower_bound(k);
            expected = it != t->bytes.end();
            if (expected)
                s.bk = it->first;
        }
        s.on = expected;
        expectEq(got, expected, "indexKeySeek");
    }

    void indexFetch(HostCursor& c) {
        ModelSlot& s = slots_[c.slot];
        ModelTable* t = tableOf(s);
        noteBroken(s);
        // Nothing is fetched on a cursor opened on an integer-keyed table, nor on one standing on
        // an integer key (a slot kept over a reset may have been reopened on such a table).
        bool intTable = (s.flags & 1) != 0 || (t != nullptr && t->intKey && s.on);
        if (intKeyed(c) && !opt_.oddInputs)
            return;
        std::string prefix = randomBytes().substr(0, static_cast<std::size_t>(pick(3)));
        if (t != nullptr && !t->intKey && s.on && chance(50))
            prefix =
                s.bk.substr(0, static_cast<std::size_t>(pick(static_cast<int>(s.bk.size()) + 1)));
        last_ = "indexKeyFetch " + std::to_string(prefix.size()) + " bytes";
        std::string payload = "old";
        bool got = c.obj->indexKeyFetch(prefix.data(), prefix.size(), payload);
        std::string expectedPayload = "old";
        bool expected = false;
        if (!intTable) {
            std::string key = (t != nullptr && s.on) ? s.bk : std::string();
            if (key.size() >= prefix.size()) {
                expectedPayload.resize(key.size() - prefix.size());
                if (key.compare(0, prefix.size(), prefix) == 0) {
                    expected = true;
                    expectedPayload = key.substr(prefix.size());
                }
            }
        }
        expectEq(got, expected, "indexKeyFetch");
        expectTrue(payload == expectedPayload, "indexKeyFetch payload");
    }

    void walk(HostCursor& c) {
        for (int guard = 0; guard < 200; ++guard) {
            ModelSlot& s = slots_[c.slot];
            if (guard > 0 && !s.on)
                break;
            ModelTable* t = tableOf(s);
            noteBroken(s);
            bool got;
            bool expected = false;
            if (guard == 0) {
                last_ = "walk: first";
                got = c.obj->first();
                if (t != nullptr)
                    loadRead(s.root);
                if (t != nullptr)
                    expected = t->intKey ? stepIn(t->ints, s.ik, s.on, 0)
                                         : stepIn(t->bytes, s.bk, s.on, 0);
            } else {
                last_ = "walk: next";
                got = c.obj->next();
                if (t != nullptr)
                    expected = t->intKey ? stepIn(t->ints, s.ik, s.on, 2)
                                         : stepIn(t->bytes, s.bk, s.on, 2);
            }
            s.on = expected;
            expectEq(got, expected, last_.c_str());
            if (s.on)
                read(c);
        }
    }

    void oneStep() {
        int r = pick(100);
        if (r < 8) {
            if (static_cast<int>(tables_.size()) < opt_.maxTables)
                createTable();
        } else if (r < 11) {
            if (chance(opt_.destroyTablePercent))
                destroyTable();
        } else if (r < 20) {
            if (static_cast<int>(cursors_.size()) < opt_.maxCursors)
                openCursor();
        } else if (r < 26) {
            destroyCursor();
        } else if (r < 27) {
            if (opt_.allowReset && chance(40))
                reset();
        } else if (r < 29 && opt_.pagerCopies) {
            pagerAction();
        } else {
            HostCursor* c = someCursor();
            if (c == nullptr) {
                if (static_cast<int>(tables_.size()) < opt_.maxTables)
                    createTable();
                else
                    openCursor();
                return;
            }
            lastSlot_ = static_cast<long long>(c->slot);
            if (chance(opt_.insertPercent)) {
                insert(*c);
                return;
            }
            int a = pick(65);
            if (a < 15)
                seek(*c);
            else if (a < 37)
                move(*c);
            else if (a < 45)
                read(*c);
            else if (a < 52)
                indexSeek(*c);
            else if (a < 59)
                indexFetch(*c);
            else
                walk(*c);
        }
    }

    void check() {
        expectEq(KovTestAccess::engine() != nullptr, engineOpen_, "engine open");
        // The host is told of a failure from the step that met it until reset().
        const bool failed = KovPager::instance()->failed();
        if (writesRefused_)
            expectTrue(failed, "failed() after a fault that ended the writes");
        else if (!faultSinceReset_)
            expectTrue(!failed, "failed() without a fault: " + KovPager::instance()->failure());
        expectEq(KovPager::instance()->failure().empty(), !failed, "failure() empty");
        const auto& real = KovTestAccess::slots();
        if (real.size() != slots_.size()) {
            expectEq(real.size(), slots_.size(), "registry size");
            stopped_ = true;  // the model cannot follow any longer
            commitPending();
            return;
        }
        for (std::size_t i = 0; i < real.size(); ++i) {
            const ModelSlot& s = slots_[i];
            expectEq(real[i].rootPage, s.live ? s.root : 0xFFFFFFFFu, "slot root");
            expectEq(real[i].tableFlags, s.flags, "slot flags");
            expectEq(real[i].cursor != nullptr, s.live && s.handle != Handle::None, "slot handle");
        }
        for (auto& c : cursors_) {
            ModelSlot& s = slots_[c->slot];
            ModelTable* t = tableOf(s);
            if (t != nullptr && t->broken)
                continue;
            expectEq(c->obj->good(), t != nullptr && s.on, "good");
            std::int64_t k = -12345;
            c->obj->key(k);
            expectEq(k, keySizeOf(s), "key");
        }
    }

    // ---- loads -------------------------------------------------------------------------------

    // The statistics of the engine about to close go into the run's sum.
    void harvestLoadStats() {
        if (engineOpen_ && openEngine() != nullptr)
            addLoads(loadTotals_, kov::engine::TEST_loadStats(openEngine()));
    }
    // The pager's engine while it is open; null otherwise (a reset through a pager copy closes
    // the engine the pager still names).
    static kov::engine::Btree* openEngine() {
        kov::engine::Btree* engine = KovTestAccess::engine();
        return kov::engine::sqlite3BtreeIsOpen(engine) ? engine : nullptr;
    }
    static std::string intKeyText(std::int64_t k) {
        std::string text(8, '\0');
        std::memcpy(&text[0], &k, 8);
        return text;
    }
    static bool pendingEntries(const ModelTable& t) { return !t.load.entries.empty(); }
    bool anyPendingEntries() const {
        for (const auto& [root, t] : db_) {
            (void)root;
            if (pendingEntries(t))
                return true;
        }
        return false;
    }
    bool anyUncertain() const {
        for (const auto& [root, t] : db_) {
            (void)root;
            if (t.load.uncertain)
                return true;
        }
        return false;
    }
    // Key order of gathered entries (the engine's, as std::map's).
    static bool keyBefore(const ModelTable& t, const Gathered& a, const Gathered& b) {
        return t.intKey ? a.ik < b.ik : a.bk < b.bk;
    }
    // Whether the entries arrived in strictly increasing key order (a load in key order).
    static bool arrivedInOrder(const ModelTable& t, const std::vector<Gathered>& entries) {
        for (std::size_t i = 1; i < entries.size(); ++i) {
            if (!keyBefore(t, entries[i - 1], entries[i]))
                return false;
        }
        return true;
    }
    // Whether every one of `entries` lies above the B-tree's last key (an empty B-tree always).
    static bool appendsAfterMerged(const ModelTable& t, const std::vector<Gathered>& entries) {
        if (entries.empty())
            return false;
        const Gathered* smallest = &entries.front();
        for (const Gathered& g : entries) {
            if (keyBefore(t, g, *smallest))
                smallest = &g;
        }
        if (t.intKey)
            return t.mergedInts.empty() || smallest->ik > t.mergedInts.rbegin()->first;
        return t.mergedBytes.empty() || smallest->bk > t.mergedBytes.rbegin()->first;
    }
    // Puts gathered entries into the B-tree's content, oldest first (the newest wins), and keeps
    // what each key held before, in case a fault stops the merge half-way.
    void mergeEntries(std::uint32_t root, ModelTable& t, const std::vector<Gathered>& entries) {
        std::map<std::string, MergeChange>& changes = stepMerges_[root];
        for (const Gathered& g : entries) {
            const std::string key = t.intKey ? intKeyText(g.ik) : g.bk;
            auto seen = changes.find(key);
            if (seen == changes.end()) {
                MergeChange change;
                if (t.intKey) {
                    auto it = t.mergedInts.find(g.ik);
                    change.hadOld = it != t.mergedInts.end();
                    if (change.hadOld)
                        change.old = it->second;
                } else {
                    auto it = t.mergedBytes.find(g.bk);
                    change.hadOld = it != t.mergedBytes.end();
                    if (change.hadOld)
                        change.old = it->second;
                }
                seen = changes.emplace(key, change).first;
            }
            seen->second.now = g.data;
            if (t.intKey)
                t.mergedInts[g.ik] = g.data;
            else
                t.mergedBytes[g.bk] = g.data;
        }
    }
    static void clearLoad(ModelTable& t) {
        const std::uint32_t inserts = t.load.insertsSinceRead;
        t.load = LoadModel{};
        t.load.insertsSinceRead = inserts;
    }
    // Whether two runs of the load hold an equal key.
    static bool runsShareAKey(const ModelTable& t) {
        std::map<std::string, std::uint32_t> firstRun;
        for (const Gathered& g : t.load.entries) {
            if (g.batch >= t.load.runs)
                continue;  // in the buffer
            const std::string key = t.intKey ? intKeyText(g.ik) : g.bk;
            auto it = firstRun.emplace(key, g.batch).first;
            if (it->second != g.batch)
                return true;
        }
        return false;
    }
    // What the table gathered goes into its B-tree (a read, or an insert straight in).
    void mergeLoad(std::uint32_t root, ModelTable& t) {
        if (!t.load.pending)
            return;
        if (writesRefused_ && !mergesGoOn_) {
            clearLoad(t);  // the engine refuses writes: what was gathered is lost
            return;
        }
        ++expect_.merges;
        if (!t.load.entries.empty()) {
            stepWork_ += " merge";
            if (appendsAfterMerged(t, t.load.entries))
                ++expect_.mergedByAppend;
            else
                ++loadReport_.mergesByInserts;
            if (runsShareAKey(t))
                ++loadReport_.mergesOverEqualKeys;
            mergeEntries(root, t, t.load.entries);
        }
        clearLoad(t);
    }
    // A read of the table: First, Last or a move-to on any of its cursors, a read cursor opened.
    void loadRead(std::uint32_t root) {
        ModelTable* t = tableAt(root);
        if (t == nullptr)
            return;
        if (t->load.insertsSinceRead > 0)
            ++loadReport_.readsBetweenInserts;
        t->load.insertsSinceRead = 0;
        mergeLoad(root, *t);
    }
    std::size_t gatheredBytes() const {
        std::size_t n = 0;
        for (const auto& [root, t] : db_) {
            (void)root;
            n += t.load.bufferBytes;
        }
        return n;
    }
    // The load memory is full: the largest buffer is appended to its table (when it has no run and
    // arrived in key order above the table's last key), or written as a run.
    void spillLargest() {
        std::size_t largest = 0;
        std::vector<std::uint32_t> candidates;
        for (const auto& [root, t] : db_) {
            if (!t.load.pending || t.load.bufferBytes < largest || t.load.bufferBytes == 0)
                continue;
            if (t.load.bufferBytes > largest)
                candidates.clear();
            largest = t.load.bufferBytes;
            candidates.push_back(root);
        }
        if (candidates.empty())
            return;
        if (candidates.size() > 1 || anyUncertain()) {
            ++loadReport_.ambiguousSpills;
            for (auto& [root, t] : db_) {
                (void)root;
                if (t.load.pending)
                    t.load.uncertain = true;
            }
            restartStats_ = true;
        }
        const std::uint32_t root = candidates.front();
        ModelTable& t = db_[root];
        if (t.load.runs == 0 && arrivedInOrder(t, t.load.entries) &&
            appendsAfterMerged(t, t.load.entries)) {
            stepWork_ += " append";
            ++expect_.merges;
            ++expect_.mergedByAppend;
            mergeEntries(root, t, t.load.entries);
            t.load.entries.clear();
        } else {
            stepWork_ += " run";
            ++t.load.runs;
            ++expect_.runsWritten;
        }
        t.load.bufferBytes = 0;
    }
    // An insert the engine took: gathered, or straight into the B-tree after what was gathered.
    void loadInsert(std::uint32_t root, ModelTable& t, std::int64_t ik, const std::string& bk,
                    const std::string& data) {
        const kov::engine::LoadLimits& limits = opt_.loads;
        const std::size_t need = kov::engine::LoadBuffer::footprint(
            t.intKey ? 0 : static_cast<std::uint32_t>(bk.size()),
            static_cast<std::uint32_t>(data.size()));
        const bool gathering =
            t.load.insertsSinceRead >= limits.directInserts && need <= limits.bufferBytes / 4;
        if (t.load.insertsSinceRead < UINT32_MAX)
            ++t.load.insertsSinceRead;
        if (!gathering) {
            mergeLoad(root, t);
            if (t.intKey)
                t.mergedInts[ik] = data;
            else
                t.mergedBytes[bk] = data;
            return;
        }
        if (gatheredBytes() + need > limits.bufferBytes)
            spillLargest();
        ModelTable& into = db_[root];  // (the same table: spilling adds none)
        Gathered g;
        g.ik = ik;
        g.bk = bk;
        g.data = data;
        g.batch = into.load.runs;
        into.load.pending = true;
        into.load.entries.push_back(std::move(g));
        into.load.bufferBytes += need;
        ++expect_.gathered;
    }
    // After a checked step: the engine's load statistics are the model's.
    void checkLoadStats() {
        if (!engineOpen_ || openEngine() == nullptr || unmodelled_ || faultSinceReset_ ||
            writesRefused_ || anyUncertain())
            return;
        const kov::engine::LoadStats got = kov::engine::TEST_loadStats(openEngine());
        if (restartStats_) {
            // Uncertain no longer: follow the engine's figures from here.
            expect_ = got;
            restartStats_ = false;
            return;
        }
        expectEq(got.gathered, expect_.gathered, "inserts gathered");
        expectEq(got.runsWritten, expect_.runsWritten, "runs written");
        expectEq(got.merges, expect_.merges, "loads merged");
        expectEq(got.mergedByAppend, expect_.mergedByAppend, "loads merged by appending");
        ++loadReport_.statsChecked;
    }
    // A fresh engine: nothing gathered, no statistics.
    void restartLoads() {
        expect_ = kov::engine::LoadStats{};
        restartStats_ = false;
    }

    // Compares a table read back after a fault that ended the writes with what the model knows
    // was merged into it (`refused`: keys of inserts the fault met, which may or may not be
    // there).
    template <typename Map, typename KeyText>
    void classifyMerged(std::uint32_t root, const Map& current, const Map& merged,
                        const Map& truth, const std::vector<std::string>& refused,
                        KeyText keyText) {
        const std::map<std::string, MergeChange>* partial = nullptr;
        auto found = faultMerges_.find(root);
        if (found != faultMerges_.end())
            partial = &found->second;
        auto skip = [&](const std::string& key) {
            for (const auto& r : refused) {
                if (r == key)
                    return true;
            }
            return false;
        };
        std::uint64_t lostMerged = 0;
        std::uint64_t lostGathered = 0;
        std::uint64_t extra = 0;
        for (const auto& e : merged) {
            const std::string key = keyText(e.first);
            if (skip(key))
                continue;
            auto it = truth.find(e.first);
            bool ok = it != truth.end() && it->second == e.second;
            if (!ok && partial != nullptr) {
                // Merged half-way: the key may still hold what it held before the merge, and
                // then lost an entry that was still gathered.
                auto change = partial->find(key);
                if (change != partial->end()) {
                    const MergeChange& c = change->second;
                    ok = c.hadOld ? it != truth.end() && it->second == c.old : it == truth.end();
                    lostGathered += ok ? 1 : 0;
                }
            }
            lostMerged += ok ? 0 : 1;
        }
        for (const auto& e : truth) {
            const std::string key = keyText(e.first);
            if (skip(key) || merged.count(e.first) != 0)
                continue;
            ++extra;  // neither merged nor held before a merge (those are in `merged` too)
        }
        for (const auto& e : current) {
            if (skip(keyText(e.first)))
                continue;
            auto m = merged.find(e.first);
            auto it = truth.find(e.first);
            const bool wasGathered = m == merged.end() || m->second != e.second;
            if (wasGathered && (it == truth.end() || it->second != e.second))
                ++lostGathered;
        }
        report_.entriesLostMerged += lostMerged;
        report_.entriesLostGathered += lostGathered;
        ++(lostMerged == 0 && extra == 0 ? report_.tablesAsMerged : report_.tablesNotAsMerged);
    }

    // ---- faults ------------------------------------------------------------------------------

    bool anyBroken() const {
        for (const auto& [root, t] : db_) {
            (void)root;
            if (t.broken)
                return true;
        }
        return false;
    }

    // Every slot's handle as the registry has it (a damaged engine may refuse reopens).
    void adoptHandles() {
        const auto& real = KovTestAccess::slots();
        for (std::size_t i = 0; i < real.size() && i < slots_.size(); ++i) {
            ModelSlot& s = slots_[i];
            if (!s.live)
                continue;
            if (real[i].cursor == nullptr) {
                s.handle = Handle::None;
                s.on = false;
            } else if (s.handle == Handle::None) {
                s.handle = engineOpen_ ? Handle::Open : Handle::Inert;
            }
        }
    }

    HostCursor* hostOfSlot(std::size_t slot) {
        for (auto& c : cursors_) {
            if (c->slot == slot)
                return c.get();
        }
        return nullptr;
    }

    // Takes a slot's position from the store.
    void adoptPosition(std::size_t i) {
        ModelSlot& s = slots_[i];
        s.on = false;
        HostCursor* c = hostOfSlot(i);
        ModelTable* t = tableOf(s);
        if (c == nullptr || t == nullptr || !c->obj->good())
            return;
        if (t->intKey) {
            std::int64_t k = 0;
            c->obj->key(k);
            s.on = t->ints.count(k) != 0;
            s.ik = k;
        } else {
            // The key in place. Once the model has stopped following the store (a pager copy
            // assigned back), the engine cursor may stand on a table of integer keys at this
            // root, whose key size is the integer key, no length: there is no byte key to take.
            const std::vector<kov::pager::CursorSlot>& registry = KovTestAccess::slots();
            const auto index = static_cast<std::size_t>(KovTestAccess::slotIndex(*c->obj));
            if (index >= registry.size())
                return;
            std::uint32_t length = 0;
            const void* key = kov::engine::sqlite3BtreeKeyFetch(registry[index].cursor, &length);
            if (key == nullptr) {
                expectTrue(unmodelled_, "a byte-string table's entry has no byte key");
                return;
            }
            const std::string k(static_cast<const char*>(key), length);
            s.on = t->bytes.count(k) != 0;
            s.bk = k;
        }
    }

    // Reads one table back through the engine and makes it the model's; `classify` adds the
    // comparison with the model to the report.
    // The engine's result codes used here (SQLite's values; <sqlite3.h>, which a program may
    // include after this header, defines the names as macros, so they are not spelled out).
    static constexpr int kEngineOk = 0;
    static constexpr int kEngineCorrupt = 11;
    // Far longer than any key the program makes (at most a few dozen bytes).
    static constexpr std::int64_t kLargestKey = std::int64_t{1} << 20;

    void resyncTable(std::uint32_t root, ModelTable& t, bool classify) {
        namespace eng = kov::engine;
        ModelTable truth;
        truth.intKey = t.intKey;
        truth.hasData = t.hasData;
        eng::BtCursor* cur = nullptr;
        int rc = eng::sqlite3BtreeCursor(KovTestAccess::engine(), root, 0, nullptr, nullptr, &cur);
        int res = 1;
        if (rc == kEngineOk)
            rc = eng::sqlite3BtreeFirst(cur, &res);
        const std::size_t bound = t.size() + 1000;
        for (std::size_t n = 0; rc == kEngineOk && res == 0; ++n) {
            if (n > bound) {
                mismatch("table walk does not end");
                rc = kEngineCorrupt;
                break;
            }
            std::int64_t keySize = 0;
            std::uint32_t dataSize = 0;
            eng::sqlite3BtreeKeySize(cur, &keySize);
            eng::sqlite3BtreeDataSize(cur, &dataSize);
            std::string data(dataSize, '\0');
            if (dataSize > 0)
                rc = eng::sqlite3BtreeData(cur, 0, dataSize, &data[0]);
            if (t.intKey) {
                truth.ints[keySize] = data;
            } else {
                // A table of integer keys at this root would give its key here, no length.
                if (keySize < 0 || keySize > kLargestKey) {
                    mismatch("key size " + std::to_string(keySize) + " of a byte-string table");
                    rc = kEngineCorrupt;
                    break;
                }
                std::string key(static_cast<std::size_t>(keySize), '\0');
                if (keySize > 0 && rc == kEngineOk)
                    rc = eng::sqlite3BtreeKey(cur, 0, static_cast<std::uint32_t>(keySize), &key[0]);
                truth.bytes[key] = data;
            }
            if (rc == kEngineOk)
                rc = eng::sqlite3BtreeNext(cur, &res);
        }
        if (cur != nullptr)
            eng::sqlite3BtreeCloseCursor(cur);
        truth.broken = rc != kEngineOk;
        if (classify && writesRefused_ && !mergesGoOn_) {
            std::vector<std::string> refused;
            for (const auto& r : refused_) {
                if (r.root == root)
                    refused.push_back(r.key);
            }
            if (t.load.uncertain)
                ++report_.tablesUncertain;
            else if (!truth.broken && t.intKey)
                classifyMerged(root, t.ints, t.mergedInts, truth.ints, refused, intKeyText);
            else if (!truth.broken)
                classifyMerged(root, t.bytes, t.mergedBytes, truth.bytes, refused,
                               [](const std::string& k) { return k; });
        }
        if (classify) {
            std::uint64_t lost = 0;
            std::uint64_t extra = 0;
            // The inserts that a fault refused: the model took them, the store should not have.
            // Newest first, so that each one that did not happen gives the model back what the
            // one before it left.
            std::set<std::string> settled;
            for (auto r = refused_.rbegin(); r != refused_.rend(); ++r) {
                if (r->root != root || settled.count(r->key) != 0)
                    continue;
                int outcome;
                if (t.intKey) {
                    std::int64_t k = 0;
                    std::memcpy(&k, r->key.data(), 8);
                    outcome = resolveRefused(t.ints, truth.ints, k, *r);
                } else {
                    outcome = resolveRefused(t.bytes, truth.bytes, r->key, *r);
                }
                if (outcome >= 0)
                    settled.insert(r->key);
                ++(outcome > 0 ? report_.refusedInsertsStored : report_.refusedInsertsDropped);
            }
            if (t.intKey) {
                for (const auto& e : t.ints) {
                    auto it = truth.ints.find(e.first);
                    lost += (it == truth.ints.end() || it->second != e.second) ? 1 : 0;
                }
                for (const auto& e : truth.ints)
                    extra += t.ints.count(e.first) == 0 ? 1 : 0;
            } else {
                for (const auto& e : t.bytes) {
                    auto it = truth.bytes.find(e.first);
                    lost += (it == truth.bytes.end() || it->second != e.second) ? 1 : 0;
                }
                for (const auto& e : truth.bytes)
                    extra += t.bytes.count(e.first) == 0 ? 1 : 0;
            }
            report_.entriesLost += lost;
            if (truth.broken)
                ++report_.tablesBroken;
            else if (extra > 0)
                ++report_.tablesChanged;
            else if (lost > 0)
                ++report_.tablesLostSome;
            else
                ++report_.tablesIntact;
        }
        truth.mergedInts = truth.ints;
        truth.mergedBytes = truth.bytes;
        t = std::move(truth);
    }

    // Inserts that a fault met: the table, the key as the model holds it, and what it replaced.
    struct Refused {
        std::uint32_t root;
        std::string key;
        bool hadOld;
        std::string old;
    };

    // An insert a fault met. 1: the store holds what the model took (the insert was stored, or a
    // later one settled the key). Otherwise the model goes back to what the insert replaced (or
    // to no entry): 0 when that is what the store holds, -1 when an older insert must tell.
    template <typename Map, typename Key>
    static int resolveRefused(Map& model, const Map& truth, const Key& key, const Refused& r) {
        auto now = truth.find(key);
        auto took = model.find(key);
        if (now != truth.end() && took != model.end() && now->second == took->second)
            return 1;
        if (r.hadOld)
            model[key] = r.old;
        else
            model.erase(key);
        took = model.find(key);
        const bool same = now == truth.end() ? took == model.end()
                                             : took != model.end() && took->second == now->second;
        return same ? 0 : -1;
    }

    void resync() {
        ++report_.resyncs;
        dirty_ = false;
        struct Clear {
            std::vector<Refused>& v;
            ~Clear() { v.clear(); }
        } clearRefused{refused_};
        if (engineOpen_ && KovTestAccess::engine() != nullptr) {
            // Tables the host can still reach (a host table, or a cursor) are compared; the
            // others (destroyed while a cursor was open) are only read back.
            std::map<std::uint32_t, bool> reachable;
            for (const auto& t : tables_)
                reachable[t->root] = true;
            for (const auto& sl : slots_) {
                if (sl.live)
                    reachable[sl.root] = true;
            }
            for (auto& [root, t] : db_)
                resyncTable(root, t, reachable.count(root) != 0);
        }
        adoptHandles();
        for (std::size_t i = 0; i < slots_.size(); ++i) {
            if (slots_[i].live)
                adoptPosition(i);
        }
        faultMerges_.clear();
        degraded_ = anyBroken();
        if (!degraded_ && engineOpen_ && KovTestAccess::engine() != nullptr && !databaseSound()) {
            // Every table reads back, but the database's own structure is damaged (an insert
            // that failed half-way, with no journal to undo it): later writes are not defined.
            // While the engine refuses writes nothing can change what was read back, so every
            // answer is still checked.
            ++report_.damagedButReadable;
            degraded_ = !writesRefused_;
        }
    }

    // SQLite's own integrity check of the whole database. Any finding counts, even a page that no
    // table uses: such a page is what an insert that failed half-way leaves, and later inserts
    // into such a database have been seen to damage tables that read back whole.
    static bool databaseSound() {
        int problems = 0;
        std::string report;
        return kov::engine::sqlite3BtreeIntegrityCheck(KovTestAccess::engine(), 10, &problems,
                                                       &report) == 0 &&
               problems == 0;
    }

    ChoiceSource& in_;
    ProgramOptions opt_;
    kov::engine::test::ScopedLoadLimits loads_;
    int step_ = 0;
    std::uint64_t operations_ = 0;
    std::string last_;
    bool engineOpen_ = false;
    int generation_ = 0;
    bool dirty_ = false;
    bool degraded_ = false;
    bool unmodelled_ = false;  // the model stopped following the store (pager copies)
    bool faultSinceReset_ = false;
    bool writesRefused_ = false;
    // Writes were refused for room or for the file (nothing lost): merges go on.
    bool mergesGoOn_ = false;
    bool unchecked_ = false;
    bool stopped_ = false;
    std::uint64_t mismatches_ = 0;
    std::vector<std::string> texts_;
    std::vector<std::string> pending_;
    long long lastSlot_ = -1;
    std::uint32_t lastInsertRoot_ = 0;
    std::string lastInsertKey_;
    bool lastHadOld_ = false;  // what the last insert replaced (noteReplaced)
    std::string lastOld_;
    std::vector<Refused> refused_;
    FaultReport report_;
    LoadReport loadReport_;
    kov::engine::LoadStats loadTotals_;  // of the engines closed so far
    kov::engine::LoadStats expect_;      // the open engine's, as the model has them
    bool restartStats_ = false;
    std::string stepWork_;  // the load work of the step (FaultReport::faultedLoadWork)
    // Merges made during the step, and during the faulted steps since the last resync, by root.
    std::map<std::uint32_t, std::map<std::string, MergeChange>> stepMerges_;
    std::map<std::uint32_t, std::map<std::string, MergeChange>> faultMerges_;
    std::map<std::uint32_t, ModelTable> db_;
    std::vector<ModelSlot> slots_;
    std::vector<std::unique_ptr<HostTable>> tables_;
    std::vector<std::unique_ptr<HostCursor>> cursors_;
    std::vector<std::unique_ptr<PagerCopy>> copies_;
};

StoreProgram::StoreProgram(ChoiceSource& choices, ProgramOptions options)
    : impl_(std::make_unique<Impl>(choices, std::move(options))) {}
StoreProgram::~StoreProgram() = default;

void StoreProgram::run(int steps) { impl_->run(steps); }
void StoreProgram::begin() { impl_->begin(); }
void StoreProgram::step() { impl_->step(); }
void StoreProgram::end() { impl_->end(); }
std::uint64_t StoreProgram::steps() const { return impl_->steps(); }
std::uint64_t StoreProgram::operations() const { return impl_->operations(); }
std::uint64_t StoreProgram::mismatches() const { return impl_->mismatches(); }
bool StoreProgram::writesRefused() const { return impl_->writesRefused(); }
const std::vector<std::string>& StoreProgram::mismatchTexts() const {
    return impl_->mismatchTexts();
}
std::string StoreProgram::firstMismatch() const { return impl_->firstMismatch(); }
const FaultReport& StoreProgram::faultReport() const { return impl_->faultReport(); }
const LoadReport& StoreProgram::loadReport() const { return impl_->loadReport(); }
bool StoreProgram::stopped() const { return impl_->stopped(); }
std::uint64_t StoreProgram::modelBytes() const { return impl_->modelBytes(); }
bool StoreProgram::dirty() const { return impl_->dirty(); }
ProgramOptions& StoreProgram::options() { return impl_->options(); }
bool StoreProgram::degraded() const { return impl_->degraded(); }
void StoreProgram::forceReset() { impl_->forceReset(); }

}  // namespace kovtest
