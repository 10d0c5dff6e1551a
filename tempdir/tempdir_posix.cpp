// POSIX candidates for the temporary directory.
//
// The environment first ($KOV_TEMP, then the usual $TEMP, $TMP and $TMPDIR), then /var/tmp, then
// /tmp. /var/tmp comes before /tmp on purpose: /tmp is often a RAM-backed tmpfs, and the store's
// temporary file exists for data larger than memory, so the disk-backed /var/tmp is the better
// default. /tmp, the last candidate, is created when missing.
#include "tempdir/TempDirectorySearch.h"

namespace kov {

std::vector<TempDirectoryCandidate> tempDirectoryCandidates() {
    return {
        TempDirectoryCandidate::variable("KOV_TEMP"), TempDirectoryCandidate::variable("TEMP"),
        TempDirectoryCandidate::variable("TMP"),      TempDirectoryCandidate::variable("TMPDIR"),
        TempDirectoryCandidate::fixed("/var/tmp"),    TempDirectoryCandidate::fixed("/tmp"),
    };
}

// "/" (however many slashes) names the file system's root: no place for the store's temporary
// file, and it would publish as an empty text, so it is passed over like an unset variable.
bool separatorOnlyValuesAreSkipped() {
    return true;
}

const std::string& tempDirectorySeparators() {
    // Only "/" separates; a trailing backslash is part of the last name and is kept.
    static const std::string separators("/");
    return separators;
}

}  // namespace kov
