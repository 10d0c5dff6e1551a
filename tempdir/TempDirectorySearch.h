// The candidate search behind getTempDirectory(): walks a list of candidate directories and settles
// on one. getTempDirectory() always walks the platform's fixed list (tempDirectoryCandidates());
// the search takes any list so that the same walk can be run over other lists.
//
// The walk, over candidates c[0] .. c[n-1], with one directory object `dir` (initially the empty
// path, which never exists) and a `source` text:
//   1. For each candidate in order:
//      - a variable candidate sets `source` to the variable's name, reads the variable
//        (getEnvironmentVariable), and `dir` becomes the directory of its value; where the
//        platform says so (separatorOnlyValuesAreSkipped()), a value made only of separators
//        (tempDirectorySeparators()) is taken as unset, that is as the empty path;
//      - a fixed candidate clears `source`, and `dir` becomes the directory of its path;
//      - a located candidate clears `source` and runs its locator; only when the locator finds a
//        path does `dir` become the directory of that path, otherwise `dir` keeps the previous
//        candidate (which did not exist), so the located candidate is in effect skipped.
//      If this is not the last candidate and `dir` exists as a directory, the walk stops.
//      The last candidate is never tested.
//   2. `create` on whatever `dir` holds, result ignored: nothing happens when an earlier candidate
//      exists; otherwise the last candidate reached is created with its missing parents, and it is
//      used even when the creation fails. Missing candidates passed over are never created.
//   3. The answer is `dir`'s path in native form, and `source`.
// Existence tests, creation and the native form are KovDirectory's (case mode 1, not presumed
// existing): a regular file counts as missing, and so does an empty path.
//
// Thread safety: the search holds no lock of its own while testing or creating; it takes the
// environment lock only inside getEnvironmentVariable. Callable from any thread.
#ifndef KOVPAGER_TEMPDIR_TEMPDIRECTORYSEARCH_H
#define KOVPAGER_TEMPDIR_TEMPDIRECTORYSEARCH_H

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace kov {

// One place the temporary directory may be.
struct TempDirectoryCandidate {
    enum class Kind {
        variable,  // the value of an environment variable
        fixed,     // a fixed path
        located,   // a path found when the search reaches it (a platform folder)
    };

    static TempDirectoryCandidate variable(std::string name);
    static TempDirectoryCandidate fixed(std::string path);
    // `locate` gives the candidate's path, or std::nullopt when it cannot be found; it runs only
    // when the search reaches the candidate.
    static TempDirectoryCandidate located(std::string description,
                                          std::function<std::optional<std::string>()> locate);

    Kind kind;
    // The variable's name (variable), the path (fixed) or a description of the location (located).
    std::string text;
    // The locator of a located candidate; empty for the other kinds.
    std::function<std::optional<std::string>()> locate;
};

// What a search settled on.
struct TempDirectorySearchResult {
    std::string path;    // the chosen directory in native form (trailing separators not stripped)
    std::string source;  // the variable that supplied it, or empty
};

// Walks `candidates` in the way set out at the top of this file. An empty list gives an empty path
// and source, and creates nothing.
TempDirectorySearchResult searchTempDirectory(
    const std::vector<TempDirectoryCandidate>& candidates);

// The platform's fixed list, in order (defined in the platform file).
std::vector<TempDirectoryCandidate> tempDirectoryCandidates();

// The characters stripped from the end of a published directory: "/" on POSIX, where a backslash
// is an ordinary file-name character; "/" and "\\" on Windows (defined in the platform file).
const std::string& tempDirectorySeparators();

// Whether an environment value made only of separators is taken as unset: true on POSIX, where it
// names the file system's root; false on Windows, where the root of the current drive is a
// candidate like any other (defined in the platform file).
bool separatorOnlyValuesAreSkipped();

}  // namespace kov

#endif  // KOVPAGER_TEMPDIR_TEMPDIRECTORYSEARCH_H
