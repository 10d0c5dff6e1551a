// What the host programs of the load and unload tests (module_host on POSIX, dll_host_win32 on
// Windows) and the POSIX module test share: a tally of failed checks reported on stderr, the
// scratch directory the test gives in KOV_TEMP, and the listing of a directory.
#ifndef KOVPAGER_TESTS_HOST_UTIL_H
#define KOVPAGER_TESTS_HOST_UTIL_H

#ifdef _WIN32
#include "support/Win32Api.h"
#else
#include <dirent.h>
#endif

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

namespace kov::test {

// The number of checks that failed so far; a host ends with 1 when it is not 0.
inline int gHostFailures = 0;

// Notes a failed check, with what was expected, on stderr.
inline void check(bool ok, const std::string& what) {
    if (!ok) {
        std::fprintf(stderr, "host: check failed: %s\n", what.c_str());
        ++gHostFailures;
    }
}

// The value of KOV_TEMP, or empty.
inline std::string scratchDir() {
    const char* dir = std::getenv("KOV_TEMP");
    return dir != nullptr ? std::string(dir) : std::string();
}

// The names in `dir`, without "." and ".."; none when it cannot be read.
inline std::vector<std::string> entriesOf(const std::string& dir) {
    std::vector<std::string> names;
#ifdef _WIN32
    WIN32_FIND_DATAA found;
    const HANDLE h = FindFirstFileA((dir + "\\*").c_str(), &found);
    if (h == INVALID_HANDLE_VALUE)
        return names;
    do {
        const std::string name = found.cFileName;
        if (name != "." && name != "..")
            names.push_back(name);
    } while (FindNextFileA(h, &found));
    FindClose(h);
#else
    if (DIR* d = opendir(dir.c_str())) {
        while (dirent* e = readdir(d)) {
            const std::string name = e->d_name;
            if (name != "." && name != "..")
                names.push_back(name);
        }
        closedir(d);
    }
#endif
    return names;
}

// The names joined with ", ", for a message.
inline std::string joined(const std::vector<std::string>& names) {
    std::string out;
    for (const std::string& name : names)
        out += (out.empty() ? "" : ", ") + name;
    return out;
}

}  // namespace kov::test

#endif  // KOVPAGER_TESTS_HOST_UTIL_H
