// TempDirectoryCache: the process-wide record of the resolved temporary directory.
//
// One instance exists, with static storage (tempDirectoryCache()); it is built while the module
// loads, before any exported class can run, and destroyed when the module unloads. It starts
// unpublished (flag false, empty strings). publish() stores a directory and the name of the
// environment variable it came from; the flag then stays true for the rest of the process.
//
// Invariants:
//   1. initialised_ goes from false to true once and never back (outside TEST_reset()).
//   2. initialised_ is set only after mutex_ has been released by the publish that wrote path_ and
//      source_, so a reader that sees true and then takes mutex_ finds both fields written.
//   3. mutex_ is held only while strings are moved or copied: never during environment reads,
//      file-system calls or shell calls, and never together with the environment lock.
//
// Thread safety: every member function may be called from any thread at any time. Two publishes
// may race; the later one wins, whole (path and source are written under one exclusive lock).
#ifndef KOVPAGER_TEMPDIR_TEMPDIRECTORYCACHE_H
#define KOVPAGER_TEMPDIR_TEMPDIRECTORYCACHE_H

#include <atomic>
#include <shared_mutex>
#include <string>

namespace kov {

class TempDirectoryCache {
  public:
    TempDirectoryCache() = default;
    TempDirectoryCache(const TempDirectoryCache&) = delete;
    TempDirectoryCache& operator=(const TempDirectoryCache&) = delete;

    // Stores `path` and `source` (moved in) under the exclusive lock, releases it, then sets the
    // published flag (sequentially consistent exchange).
    void publish(std::string path, std::string source);

    // True once a publish has completed. One atomic load, no lock.
    bool initialised() const { return initialised_.load(); }

    // A copy of the published directory, taken under the shared lock; empty before the first
    // publish.
    std::string path() const;

    // A copy of the published source: "KOV_TEMP", "TEMP", "TMP" (or another variable of the
    // platform's candidate list) when the directory came from that environment variable, empty
    // when it came from a fixed or located candidate or from an explicit directory. Kept for
    // inspection; nothing in the library reads it.
    std::string source() const;

    // Test-only: returns the record to its load-time state (flag false, empty strings), so the next
    // getTempDirectory() resolves again. Not for library code.
    void TEST_reset();

  private:
    std::atomic<bool> initialised_{false};  // set after the first publish, never cleared
    // State below is protected by mutex_.
    std::string path_;    // resolved directory, narrow text, no trailing separator
    std::string source_;  // variable that supplied path_, or empty
    mutable std::shared_mutex mutex_;
};

// The process-wide instance (a namespace-scope static, constructed at module load).
TempDirectoryCache& tempDirectoryCache();

}  // namespace kov

#endif  // KOVPAGER_TEMPDIR_TEMPDIRECTORYCACHE_H
