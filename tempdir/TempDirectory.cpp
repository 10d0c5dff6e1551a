#include "tempdir/TempDirectory.h"

#include <cstdlib>
#include <mutex>
#include <utility>

#include "tempdir/StripCharacters.h"
#include "tempdir/TempDirectoryCache.h"
#include "tempdir/TempDirectorySearch.h"

namespace kov {

std::shared_mutex& environmentMutex() {
    static std::shared_mutex mutex;
    return mutex;
}

std::string getEnvironmentVariable(const std::string& name) {
    std::shared_lock<std::shared_mutex> lock(environmentMutex());
    const char* value = std::getenv(name.c_str());
    // The copy is made under the lock; the lock is released on every way out, a failed copy
    // included.
    return value != nullptr ? std::string(value) : std::string();
}

void resolveTempDirectory(const char* explicitDirectory) {
    std::string result;
    std::string source;
    if (explicitDirectory != nullptr) {
        result = explicitDirectory;
    } else {
        TempDirectorySearchResult found = searchTempDirectory(tempDirectoryCandidates());
        result = std::move(found.path);
        source = std::move(found.source);
    }
    result = stripCharacters(result, tempDirectorySeparators(), StripMode::trailing);
    tempDirectoryCache().publish(std::move(result), std::move(source));
}

std::string getTempDirectory() {
    TempDirectoryCache& cache = tempDirectoryCache();
    if (!cache.initialised()) {
        resolveTempDirectory(nullptr);
    }
    return cache.path();
}

}  // namespace kov
