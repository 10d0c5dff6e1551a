// Text utility for the file objects: UTF-8 is the internal form of every
// path; narrow text is what the host and the environment hand us (on POSIX
// the bytes given, on Windows the ANSI code page); UTF-16 is what the wide
// Windows calls take.
//
// Strict conversions report failure through their result and leave `out`
// unspecified; the *Lossy forms never fail and replace each undecodable
// sequence with U+FFFD (or '?' in the ANSI code page).
//
//   kov::text::Utf8Text dir(kov::text::narrowToUtf8Lossy(getenv("TEMP")));
//   std::u16string wide = kov::text::utf8ToUtf16Lossy(dir.bytes());
//
// Every function is pure and thread-safe.
#ifndef KOVPAGER_SUPPORT_TEXT_H
#define KOVPAGER_SUPPORT_TEXT_H

#include <cstddef>
#include <string>
#include <string_view>

namespace kov::text {

// A path or name held as UTF-8 (on POSIX: the bytes given, which are UTF-8
// in practice but not checked). A distinct type so that overloads taking
// narrow host text and overloads taking UTF-8 text cannot be confused.
class Utf8Text {
  public:
    Utf8Text() = default;
    explicit Utf8Text(std::string utf8) : bytes_(std::move(utf8)) {}

    const std::string& bytes() const { return bytes_; }
    std::size_t size() const { return bytes_.size(); }
    bool empty() const { return bytes_.empty(); }

    friend bool operator==(const Utf8Text& a, const Utf8Text& b) { return a.bytes_ == b.bytes_; }
    friend bool operator!=(const Utf8Text& a, const Utf8Text& b) { return a.bytes_ != b.bytes_; }

  private:
    std::string bytes_;  // UTF-8 text
};

// True when `text` is well-formed UTF-8 (no overlongs, surrogates or code
// points past U+10FFFF).
bool isValidUtf8(std::string_view text);

// UTF-8 <-> UTF-16. The strict forms return false on malformed input.
bool utf8ToUtf16(std::string_view utf8, std::u16string& out);
std::u16string utf8ToUtf16Lossy(std::string_view utf8);
bool utf16ToUtf8(std::u16string_view utf16, std::string& out);
std::string utf16ToUtf8Lossy(std::u16string_view utf16);

// Narrow (platform) text <-> UTF-8. On POSIX both directions copy the bytes
// unchanged and always succeed. On Windows narrow text is the ANSI code page.
bool narrowToUtf8(std::string_view narrow, std::string& out);
std::string narrowToUtf8Lossy(std::string_view narrow);
bool utf8ToNarrow(std::string_view utf8, std::string& out);
std::string utf8ToNarrowLossy(std::string_view utf8);

// Simple case folding (ASCII, Latin-1, Latin Extended-A, Greek and Cyrillic
// capitals to small letters). U+0130 (capital I with dot above), which has
// no simple folding, is kept as it is. Bytes that are not well-formed UTF-8
// are kept as they are, with only ASCII letters folded.
std::string foldCase(std::string_view utf8);

// Equality after foldCase.
bool equalsIgnoringCase(std::string_view a, std::string_view b);

}  // namespace kov::text

#endif  // KOVPAGER_SUPPORT_TEXT_H
