// Windows candidates for the temporary directory.
//
// %KOV_TEMP%, %TEMP%, %TMP%, then the user's local application-data folder followed by "/Temp",
// then "c:/temp", then "c:/tmp" (created when missing). The shell folder is asked for only when the
// search reaches it, and is asked not to create the folder.
// Win32Api.h first: shlobj.h needs the types of windows.h.
#include "support/Win32Api.h"

#include <shlobj.h>

#include "tempdir/TempDirectorySearch.h"

namespace kov {

namespace {

// The local application-data folder followed by "/Temp" (appended as text), or nothing when the
// shell does not answer S_OK (S_FALSE included).
std::optional<std::string> localAppDataTemp() {
    char folder[MAX_PATH] = {};
    const HRESULT status =
        SHGetFolderPathA(nullptr, CSIDL_LOCAL_APPDATA, nullptr, SHGFP_TYPE_CURRENT, folder);
    if (status != S_OK) {
        return std::nullopt;
    }
    return std::string(folder) + "/Temp";
}

}  // namespace

std::vector<TempDirectoryCandidate> tempDirectoryCandidates() {
    return {
        TempDirectoryCandidate::variable("KOV_TEMP"),
        TempDirectoryCandidate::variable("TEMP"),
        TempDirectoryCandidate::variable("TMP"),
        TempDirectoryCandidate::located("local application data/Temp", localAppDataTemp),
        TempDirectoryCandidate::fixed("c:/temp"),
        TempDirectoryCandidate::fixed("c:/tmp"),
    };
}

bool separatorOnlyValuesAreSkipped() {
    return false;
}

const std::string& tempDirectorySeparators() {
    static const std::string separators("/\\");
    return separators;
}

}  // namespace kov
