// stripCharacters: removes a set of single-byte characters from one or both ends of a narrow text.
//
// The temporary-directory code uses it to drop trailing path separators from the directory it
// publishes ("abc//" becomes "abc"). The text is narrow (the bytes given on POSIX, the ANSI code
// page on Windows). It is converted to UTF-8 (kov::text::narrowToUtf8), the bytes at the ends that
// occur in the set are dropped, and what is left is converted back (kov::text::utf8ToNarrow). In
// UTF-8 every byte below 0x80 is a whole character, so a set of ASCII separators never cuts a
// character in half, even in a double-byte code page (932, 936, 949, 950) where the second byte of
// a character may be 0x5C, the backslash. Only single-byte characters can be stripped: the set is
// compared byte by byte with the UTF-8 bytes. On POSIX both conversions copy the bytes, so the
// strip works on the bytes as given and never fails.
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

// Returns `text` without the run of bytes at the chosen end(s) of its UTF-8 form that all occur in
// `characters`, converted back to narrow text. A text made only of such bytes gives an empty
// result. An empty `text` or an empty `characters` returns `text` unchanged, with no conversion.
// A mode value outside 1..3 (its two low bits choose the ends) still takes the text through
// UTF-8 and back. Throws std::range_error when a conversion fails: on Windows, a text the ANSI
// code page does not define (a lead byte with no valid second byte, say), or a result that no
// longer converts back (a set byte that cuts a UTF-8 sequence); there is no lossy fallback. On
// POSIX it throws nothing but std::bad_alloc.
std::string stripCharacters(const std::string& text, const std::string& characters, StripMode mode);

}  // namespace kov

#endif  // KOVPAGER_TEMPDIR_STRIPCHARACTERS_H
