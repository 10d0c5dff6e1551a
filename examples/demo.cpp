// kovpager_demo: a host program that uses the store the way an application would.
//
//   kovpager_demo [--records N] [--quiet]
//
// It uses the store through its C++17 face, <kovpager/kovpager.hpp>.
//
// 1. The typical use: an integer-keyed table filled with put(), an entry read back with get(),
//    then a walk of the table from first to last, during which a second table is created (the
//    walk goes on where it was).
// 2. A data set larger than the store's 64 MiB page cache: N records (3 000 000 by default) under
//    sequential integer keys with 100 bytes of data each, and beside them a key-only index of
//    composite keys: a 4-byte group number (the key modulo 97, big-endian) followed by the
//    record's 8-byte big-endian key.
// 3. A walk over every record, checking each key and each byte of its data.
// 4. Random seeks, each checked.
// 5. A walk of every index group by its prefix, checking that each group holds exactly its keys,
//    in order.
//
// A progress bar goes to stderr while loading and walking, when stderr is a terminal and
// --quiet is not given. A summary follows: records, time and rate of each phase, peak memory,
// and the directory of the store's temporary file. The exit code is 1 when any check fails,
// 2 for a bad command line.
#include <kovpager/kovpager.hpp>

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <system_error>
#include <vector>

#if defined(_WIN32)
#include <io.h>
#define KOV_ISATTY _isatty
#else
#include <sys/resource.h>
#include <unistd.h>
#define KOV_ISATTY isatty
#endif

namespace {

constexpr std::uint32_t kGroups = 97;
constexpr std::size_t kDataSize = 100;

struct Options {
    std::int64_t records = 3000000;
    bool quiet = false;
};

// The 100 data bytes of record `key`: its decimal form, then a repeating pattern that depends on
// the key, so that every byte of every record is checked against something particular to it.
void recordData(std::int64_t key, char* out) {
    std::snprintf(out, kDataSize, "record %lld ", static_cast<long long>(key));
    std::size_t n = std::strlen(out);
    std::uint64_t x = static_cast<std::uint64_t>(key) * 0x9E3779B97F4A7C15ull + 1;
    for (std::size_t i = n; i < kDataSize; ++i) {
        x ^= x >> 29;
        x *= 0xBF58476D1CE4E5B9ull;
        out[i] = static_cast<char>('a' + (x >> 59) % 26);
    }
}

void putBigEndian(std::uint64_t v, int bytes, unsigned char* out) {
    for (int i = bytes - 1; i >= 0; --i) {
        out[i] = static_cast<unsigned char>(v & 0xFF);
        v >>= 8;
    }
}

std::uint64_t getBigEndian(const unsigned char* in, int bytes) {
    std::uint64_t v = 0;
    for (int i = 0; i < bytes; ++i)
        v = (v << 8) | in[i];
    return v;
}

// A progress bar on stderr, drawn only when asked and when stderr is a terminal.
class Progress {
  public:
    Progress(const char* label, std::int64_t total, bool enabled)
        : label_(label), total_(total), enabled_(enabled && KOV_ISATTY(2) != 0) {
        draw(0);
    }
    void update(std::int64_t done) {
        if (!enabled_ || total_ <= 0)
            return;
        const int percent = static_cast<int>(done * 100 / total_);
        if (percent != shown_)
            draw(done);
    }
    ~Progress() {
        if (enabled_)
            std::fprintf(stderr, "\r%-60s\r", "");
    }

  private:
    void draw(std::int64_t done) {
        if (!enabled_ || total_ <= 0)
            return;
        shown_ = static_cast<int>(done * 100 / total_);
        char bar[41];
        const int filled = shown_ * 40 / 100;
        for (int i = 0; i < 40; ++i)
            bar[i] = i < filled ? '#' : '.';
        bar[40] = '\0';
        std::fprintf(stderr, "\r%-8s [%s] %3d%%", label_, bar, shown_);
        std::fflush(stderr);
    }
    const char* label_;
    std::int64_t total_;
    bool enabled_;
    int shown_ = -1;
};

class Clock {
  public:
    Clock() : start_(std::chrono::steady_clock::now()) {}
    double seconds() const {
        return std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
    }

  private:
    std::chrono::steady_clock::time_point start_;
};

struct Phase {
    std::string name;
    std::int64_t items;
    double seconds;
};

int failures = 0;

void fail(const char* what, std::int64_t key) {
    if (failures < 10) {
        std::fprintf(stderr, "check failed: %s (key %lld)\n", what, static_cast<long long>(key));
    }
    ++failures;
}

// The directory of the store's temporary file, found from the open file itself where the
// system shows a process's open files (/proc/self/fd); empty where it does not.
std::string temporaryFileDirectory() {
    namespace fs = std::filesystem;
    std::error_code ec;
    for (fs::directory_iterator it("/proc/self/fd", ec), end; !ec && it != end; it.increment(ec)) {
        std::error_code linkError;
        const fs::path target = fs::read_symlink(it->path(), linkError);
        if (linkError)
            continue;
        const std::string name = target.filename().string();
        if (name.rfind("kovpager_", 0) == 0)
            return target.parent_path().string();
    }
    return {};
}

long peakMemoryKiB() {
#if defined(_WIN32)
    return -1;
#else
    struct rusage usage;
    if (getrusage(RUSAGE_SELF, &usage) != 0)
        return -1;
    return usage.ru_maxrss;  // KiB on Linux
#endif
}

bool parse(int argc, char** argv, Options& options) {
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        if (arg == "--quiet") {
            options.quiet = true;
        } else if (arg == "--records" && i + 1 < argc) {
            char* end = nullptr;
            const long long n = std::strtoll(argv[++i], &end, 10);
            if (end == argv[i] || *end != '\0' || n < 1)
                return false;
            options.records = n;
        } else {
            return false;
        }
    }
    return true;
}

// 1. The typical use of the store.
void typicalUse() {
    kovpager::IntTable numbers;
    for (std::int64_t k = 1; k <= 1000; ++k)
        numbers.put(k, "value " + std::to_string(k));
    if (numbers.get(500) != std::optional<std::string>("value 500"))
        fail("typical use: get 500", 500);

    std::int64_t expected = 1;
    for (const auto& e : numbers) {
        if (e.key() != expected || e.data() != "value " + std::to_string(expected))
            fail("typical use: walk", e.key());
        if (expected == 500)
            kovpager::BytesTable second;  // made (and dropped) in the middle of the walk
        ++expected;
    }
    if (expected != 1001)
        fail("typical use: record count", expected - 1);
}

}  // namespace

int main(int argc, char** argv) {
    Options options;
    if (!parse(argc, argv, options)) {
        std::fprintf(stderr, "usage: %s [--records N] [--quiet]\n", argv[0]);
        return 2;
    }
    const std::int64_t n = options.records;
    const bool bars = !options.quiet;
    std::vector<Phase> phases;

    Clock typicalClock;
    typicalUse();
    phases.push_back({"typical use", 1000, typicalClock.seconds()});

    kovpager::IntTable records;
    kovpager::IndexTable index;
    char data[kDataSize];
    unsigned char composite[12];

    {
        Clock clock;
        Progress bar("load", n, bars);
        for (std::int64_t k = 0; k < n; ++k) {
            recordData(k, data);
            records.put(k, std::string_view(data, kDataSize));
            putBigEndian(static_cast<std::uint64_t>(k) % kGroups, 4, composite);
            putBigEndian(static_cast<std::uint64_t>(k), 8, composite + 4);
            index.put(std::string_view(reinterpret_cast<const char*>(composite), sizeof composite));
            if ((k & 0xFFF) == 0)
                bar.update(k);
        }
        phases.push_back({"load", n, clock.seconds()});
    }
    const std::string tempDir = temporaryFileDirectory();

    {
        Clock clock;
        Progress bar("walk", n, bars);
        std::int64_t expected = 0;
        for (const auto& e : records) {
            const std::int64_t key = e.key();
            if (key != expected) {
                fail("walk: key out of order", key);
                break;
            }
            recordData(key, data);
            if (e.data() != std::string_view(data, kDataSize))
                fail("walk: data", key);
            if ((++expected & 0xFFF) == 0)
                bar.update(expected);
        }
        if (expected != n)
            fail("walk: record count", expected);
        phases.push_back({"walk", n, clock.seconds()});
    }

    {
        const std::int64_t seeks = n < 200000 ? n : 200000;
        Clock clock;
        std::mt19937_64 rng(42);
        std::uniform_int_distribution<std::int64_t> pick(0, n - 1);
        for (std::int64_t i = 0; i < seeks; ++i) {
            const std::int64_t k = pick(rng);
            const std::optional<std::string> got = records.get(k);
            recordData(k, data);
            if (!got.has_value())
                fail("seek: key not found", k);
            else if (*got != std::string_view(data, kDataSize))
                fail("seek: data", k);
        }
        if (records.get(n).has_value())
            fail("seek: past the last key", n);
        phases.push_back({"seek", seeks, clock.seconds()});
    }

    {
        Clock clock;
        Progress bar("groups", n, bars);
        std::int64_t seen = 0;
        unsigned char prefix[4];
        for (std::uint32_t g = 0; g < kGroups; ++g) {
            putBigEndian(g, 4, prefix);
            std::int64_t expected = g;
            for (const auto& e :
                 index.with_prefix(std::string_view(reinterpret_cast<const char*>(prefix), 4))) {
                const std::string_view payload = e.key().substr(4);
                const std::int64_t key =
                    payload.size() == 8
                        ? static_cast<std::int64_t>(getBigEndian(
                              reinterpret_cast<const unsigned char*>(payload.data()), 8))
                        : -1;
                if (key != expected)
                    fail("groups: member out of place", key);
                expected += kGroups;
                if ((++seen & 0xFFF) == 0)
                    bar.update(seen);
            }
            if (expected < n)
                fail("groups: group ends early", expected);
        }
        if (seen != n)
            fail("groups: entry count", seen);
        phases.push_back({"groups", seen, clock.seconds()});
    }

    std::printf("kovpager demo: %lld records of %zu bytes, index of %u groups\n",
                static_cast<long long>(n), kDataSize, kGroups);
    for (const Phase& p : phases) {
        const double rate = p.seconds > 0 ? static_cast<double>(p.items) / p.seconds : 0;
        std::printf("  %-12s %10lld items %9.3f s %12.0f /s\n", p.name.c_str(),
                    static_cast<long long>(p.items), p.seconds, rate);
    }
    const long peak = peakMemoryKiB();
    if (peak >= 0) {
        std::printf("  peak memory  %.1f MiB\n", static_cast<double>(peak) / 1024.0);
    } else {
        std::printf("  peak memory  n/a\n");
    }
    std::printf("  temporary directory  %s\n",
                tempDir.empty() ? "(none: the data fit in the page cache)" : tempDir.c_str());
    // A failure of the store (a full disk, say) shows in the checks above as missing records;
    // the store says what it was.
    if (kovpager::failed()) {
        std::printf("FAILED: %s\n", kovpager::failure().c_str());
        return 1;
    }
    if (failures != 0) {
        std::printf("FAILED: %d checks\n", failures);
        return 1;
    }
    std::printf("all checks passed\n");
    return 0;
}
