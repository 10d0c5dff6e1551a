// Narrow text on POSIX is the bytes given: file names are byte strings and
// are passed to the system unchanged, so nothing is converted or lost.
#include "support/Text.h"

namespace kov::text {

bool narrowToUtf8(std::string_view narrow, std::string& out) {
    out.assign(narrow.data(), narrow.size());
    return true;
}

std::string narrowToUtf8Lossy(std::string_view narrow) {
    return std::string(narrow);
}

bool utf8ToNarrow(std::string_view utf8, std::string& out) {
    out.assign(utf8.data(), utf8.size());
    return true;
}

std::string utf8ToNarrowLossy(std::string_view utf8) {
    return std::string(utf8);
}

}  // namespace kov::text
