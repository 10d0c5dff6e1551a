// UTF-8 / UTF-16 conversion and case folding. Portable; the narrow-text
// conversions are in Text_posix.cpp and Text_win32.cpp.
#include "support/Text.h"

namespace kov::text {
namespace {

constexpr char32_t kReplacement = 0xFFFD;

// Decodes one code point of well-formed UTF-8 at `pos`. On success returns
// true, stores the code point and advances `pos`; on malformed input returns
// false and leaves `pos` alone.
bool decodeOne(std::string_view s, std::size_t& pos, char32_t& cp) {
    const auto b0 = static_cast<unsigned char>(s[pos]);
    if (b0 < 0x80) {
        cp = b0;
        ++pos;
        return true;
    }
    std::size_t len;
    char32_t min;
    if ((b0 & 0xE0) == 0xC0) {
        len = 2;
        cp = b0 & 0x1F;
        min = 0x80;
    } else if ((b0 & 0xF0) == 0xE0) {
        len = 3;
        cp = b0 & 0x0F;
        min = 0x800;
    } else if ((b0 & 0xF8) == 0xF0) {
        len = 4;
        cp = b0 & 0x07;
        min = 0x10000;
    } else {
        return false;
    }
    if (s.size() - pos < len)
        return false;
    for (std::size_t i = 1; i < len; ++i) {
        const auto b = static_cast<unsigned char>(s[pos + i]);
        if ((b & 0xC0) != 0x80)
            return false;
        cp = (cp << 6) | (b & 0x3F);
    }
    if (cp < min || cp > 0x10FFFF || (cp >= 0xD800 && cp <= 0xDFFF))
        return false;
    pos += len;
    return true;
}

void encodeUtf8(char32_t cp, std::string& out) {
    if (cp < 0x80) {
        out.push_back(static_cast<char>(cp));
    } else if (cp < 0x800) {
        out.push_back(static_cast<char>(0xC0 | (cp >> 6)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else if (cp < 0x10000) {
        out.push_back(static_cast<char>(0xE0 | (cp >> 12)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    } else {
        out.push_back(static_cast<char>(0xF0 | (cp >> 18)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
        out.push_back(static_cast<char>(0x80 | (cp & 0x3F)));
    }
}

void encodeUtf16(char32_t cp, std::u16string& out) {
    if (cp < 0x10000) {
        out.push_back(static_cast<char16_t>(cp));
    } else {
        cp -= 0x10000;
        out.push_back(static_cast<char16_t>(0xD800 | (cp >> 10)));
        out.push_back(static_cast<char16_t>(0xDC00 | (cp & 0x3FF)));
    }
}

// Converts UTF-8 to UTF-16; malformed bytes become U+FFFD, one per byte.
// Returns whether the input was well-formed.
bool convert8to16(std::string_view in, std::u16string& out) {
    out.clear();
    out.reserve(in.size());
    bool ok = true;
    std::size_t pos = 0;
    while (pos < in.size()) {
        char32_t cp;
        if (!decodeOne(in, pos, cp)) {
            ok = false;
            cp = kReplacement;
            ++pos;
        }
        encodeUtf16(cp, out);
    }
    return ok;
}

// Converts UTF-16 to UTF-8; unpaired surrogates become U+FFFD.
bool convert16to8(std::u16string_view in, std::string& out) {
    out.clear();
    out.reserve(in.size());
    bool ok = true;
    for (std::size_t i = 0; i < in.size(); ++i) {
        char32_t cp = in[i];
        if (cp >= 0xD800 && cp <= 0xDBFF && i + 1 < in.size() && in[i + 1] >= 0xDC00 &&
            in[i + 1] <= 0xDFFF) {
            cp = 0x10000 + ((cp - 0xD800) << 10) + (in[i + 1] - 0xDC00);
            ++i;
        } else if (cp >= 0xD800 && cp <= 0xDFFF) {
            ok = false;
            cp = kReplacement;
        }
        encodeUtf8(cp, out);
    }
    return ok;
}

char32_t foldOne(char32_t c) {
    if (c >= 'A' && c <= 'Z')
        return c + 0x20;
    if (c < 0x80)
        return c;
    if (c >= 0xC0 && c <= 0xDE && c != 0xD7)
        return c + 0x20;  // Latin-1
    // Latin Extended-A. U+0130 (capital I with dot above) has no simple
    // folding of its own: it stays as it is rather than becoming U+0131
    // (dotless i), which is no fold of it.
    if (c >= 0x100 && c <= 0x137 && (c % 2) == 0 && c != 0x130)
        return c + 1;
    if (c >= 0x139 && c <= 0x148 && (c % 2) == 1)
        return c + 1;
    if (c >= 0x14A && c <= 0x177 && (c % 2) == 0)
        return c + 1;
    if (c == 0x178)
        return 0xFF;
    if (c >= 0x179 && c <= 0x17E && (c % 2) == 1)
        return c + 1;
    if (c >= 0x391 && c <= 0x3AB && c != 0x3A2)
        return c + 0x20;  // Greek
    if (c >= 0x410 && c <= 0x42F)
        return c + 0x20;  // Cyrillic
    if (c >= 0x400 && c <= 0x40F)
        return c + 0x50;
    return c;
}

}  // namespace

bool isValidUtf8(std::string_view text) {
    std::size_t pos = 0;
    char32_t cp;
    while (pos < text.size()) {
        if (!decodeOne(text, pos, cp))
            return false;
    }
    return true;
}

bool utf8ToUtf16(std::string_view utf8, std::u16string& out) {
    return convert8to16(utf8, out);
}

std::u16string utf8ToUtf16Lossy(std::string_view utf8) {
    std::u16string out;
    convert8to16(utf8, out);
    return out;
}

bool utf16ToUtf8(std::u16string_view utf16, std::string& out) {
    return convert16to8(utf16, out);
}

std::string utf16ToUtf8Lossy(std::u16string_view utf16) {
    std::string out;
    convert16to8(utf16, out);
    return out;
}

std::string foldCase(std::string_view utf8) {
    std::string out;
    out.reserve(utf8.size());
    std::size_t pos = 0;
    while (pos < utf8.size()) {
        char32_t cp;
        if (decodeOne(utf8, pos, cp)) {
            encodeUtf8(foldOne(cp), out);
        } else {
            // Not UTF-8: keep the byte (an ASCII byte would have decoded).
            out.push_back(utf8[pos]);
            ++pos;
        }
    }
    return out;
}

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
    if (a == b)
        return true;
    return foldCase(a) == foldCase(b);
}

}  // namespace kov::text
