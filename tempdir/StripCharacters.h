// stripCharacters: removes a set of single-byte characters from one or both ends of a narrow text.
//
// The temporary-directory code uses it to drop trailing path separators from the directory it
// publishes ("abc//" becomes "abc"). The text is narrow (the bytes given on POSIX, the ANSI code
// page on Windows) and is compared byte by byte with the bytes of the set, so only single-byte
// characters can be stripped; a multi-byte character is never cut in half, because its bytes are
// all outside the ASCII range and a set of ASCII separators never matches them.
//
// Examples (set "/"):
//   stripCharacters("abc//", "/", StripMode::trailing)  == "abc"
//   stripCharacters("///",   "/", StripMode::trailing)  == ""
//   stripCharacters("//abc", "/", StripMode::leading)   == "abc"
//   stripCharacters("/a/",   "/", StripMode::both)      == "a"
//   stripCharacters("",      "/", any mode)             == ""
//   stripCharacters("abc/",  "",  any mode)             == "abc/"
//
// Thread safety: a pure function; callable from any thread.
#ifndef KOVPAGER_TEMPDIR_STRIPCHARACTERS_H
#define KOVPAGER_TEMPDIR_STRIPCHARACTERS_H

#include <string>

namespace kov {

// Which ends of the text are stripped. The values are fixed: leading = 1, trailing = 2, both = 3
// (both is the two bits of leading and trailing together).
enum class StripMode : int {
    leading = 1,
    trailing = 2,
    both = 3,
};

// Returns `text` without the run of bytes at the chosen end(s) that all occur in `characters`.
// A text made only of such bytes gives an empty result. An empty `text` or an empty `characters`
// returns `text` unchanged. A mode value outside 1..3 strips nothing (its two low bits choose the
// ends). Never throws except std::bad_alloc from the result's allocation.
std::string stripCharacters(const std::string& text, const std::string& characters, StripMode mode);

}  // namespace kov

#endif  // KOVPAGER_TEMPDIR_STRIPCHARACTERS_H
