#include "tempdir/TempDirectoryCache.h"

#include <mutex>
#include <utility>

namespace kov {

namespace {
// Built at module load; the pager, its only user, first asks for it at the first use of an
// exported class, well after load.
TempDirectoryCache processTempDirectoryCache;
}  // namespace

TempDirectoryCache& tempDirectoryCache() {
    return processTempDirectoryCache;
}

void TempDirectoryCache::publish(std::string path, std::string source) {
    {
        std::unique_lock<std::shared_mutex> lock(mutex_);
        path_ = std::move(path);
        source_ = std::move(source);
    }
    // After the release: whoever sees the flag finds both fields written (invariant 2).
    initialised_.exchange(true);
}

std::string TempDirectoryCache::path() const {
    std::shared_lock<std::shared_mutex> lock(mutex_);
    return path_;
}

std::string TempDirectoryCache::source() const {
    std::shared_lock<std::shared_mutex> lock(mutex_);
    return source_;
}

void TempDirectoryCache::TEST_reset() {
    std::unique_lock<std::shared_mutex> lock(mutex_);
    initialised_.store(false);
    path_.clear();
    source_.clear();
}

}  // namespace kov
