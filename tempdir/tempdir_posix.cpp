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

bool separatorOnlyValuesAreSkipped() {
    return true;
}

const std::string& tempDirectorySeparators() {
    static const std::string separators("/");
    return separators;
}

}  // namespace kov
