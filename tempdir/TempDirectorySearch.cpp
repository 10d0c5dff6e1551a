#include "tempdir/TempDirectorySearch.h"

#include <cstdint>
#include <utility>

#include "support/KovDirectory.h"
#include "tempdir/TempDirectory.h"

namespace kov {

namespace {

// The options every candidate's directory object is made with: names compare ignoring case with
// no case resolution (so an existence test never lists a parent directory), and the status is read
// from the disk on the first query.
constexpr std::int32_t candidateCaseMode = 1;
constexpr bool candidatePresumedExisting = false;
// KovDirectory::path style for the native form as narrow text.
constexpr int nativePathStyle = 2;

lumo::ex::KovDirectory directoryOf(const std::string& path) {
    return lumo::ex::KovDirectory(path, candidateCaseMode, candidatePresumedExisting);
}

bool onlySeparators(const std::string& text) {
    return !text.empty() && text.find_first_not_of(tempDirectorySeparators()) == std::string::npos;
}

}  // namespace

TempDirectoryCandidate TempDirectoryCandidate::variable(std::string name) {
    return TempDirectoryCandidate{Kind::variable, std::move(name), {}};
}

TempDirectoryCandidate TempDirectoryCandidate::fixed(std::string path) {
    return TempDirectoryCandidate{Kind::fixed, std::move(path), {}};
}

TempDirectoryCandidate TempDirectoryCandidate::located(
    std::string description, std::function<std::optional<std::string>()> locate) {
    return TempDirectoryCandidate{Kind::located, std::move(description), std::move(locate)};
}

TempDirectorySearchResult searchTempDirectory(
    const std::vector<TempDirectoryCandidate>& candidates) {
    TempDirectorySearchResult result;
    if (candidates.empty()) {
        return result;
    }
    lumo::ex::KovDirectory dir = directoryOf(std::string());
    for (std::size_t i = 0; i < candidates.size(); ++i) {
        const TempDirectoryCandidate& candidate = candidates[i];
        switch (candidate.kind) {
            case TempDirectoryCandidate::Kind::variable: {
                // The source is set first; it is also the name looked up.
                result.source = candidate.text;
                std::string value = getEnvironmentVariable(result.source);
                if (separatorOnlyValuesAreSkipped() && onlySeparators(value)) {
                    value.clear();
                }
                dir = directoryOf(value);
                break;
            }
            case TempDirectoryCandidate::Kind::fixed:
                result.source.clear();
                dir = directoryOf(candidate.text);
                break;
            case TempDirectoryCandidate::Kind::located: {
                result.source.clear();
                std::optional<std::string> found;
                if (candidate.locate) {
                    found = candidate.locate();
                }
                if (found) {
                    dir = directoryOf(*found);
                }
                break;
            }
        }
        const bool last = i + 1 == candidates.size();
        if (!last && dir.exists()) {
            break;
        }
    }
    // Nothing happens when an earlier candidate exists; otherwise the last candidate reached is
    // made, and used whether or not that worked.
    static_cast<void>(dir.create());
    result.path = dir.path(nativePathStyle);
    return result;
}

}  // namespace kov
