// Narrow text on Windows is the ANSI code page; it goes through UTF-16 with
// MultiByteToWideChar / WideCharToMultiByte. The strict forms refuse
// characters the code page cannot hold; the lossy forms let Windows put its
// default character in their place.
#include "support/Win32Api.h"

#include <climits>

#include "support/Text.h"

namespace kov::text {
namespace {

bool ansiToWide(std::string_view narrow, bool strict, std::wstring& out) {
    out.clear();
    if (narrow.empty())
        return true;
    if (narrow.size() > static_cast<std::size_t>(INT_MAX))
        return false;
    const DWORD flags = strict ? MB_ERR_INVALID_CHARS : 0;
    const int n = MultiByteToWideChar(CP_ACP, flags, narrow.data(), static_cast<int>(narrow.size()),
                                      nullptr, 0);
    if (n <= 0)
        return false;
    out.resize(static_cast<std::size_t>(n));
    return MultiByteToWideChar(CP_ACP, flags, narrow.data(), static_cast<int>(narrow.size()),
                               &out[0], n) == n;
}

bool wideToAnsi(const std::wstring& wide, bool strict, std::string& out) {
    out.clear();
    if (wide.empty())
        return true;
    if (wide.size() > static_cast<std::size_t>(INT_MAX))
        return false;
    BOOL usedDefault = FALSE;
    // No best-fit mapping: a character the code page lacks is not swapped for a look-alike
    // (an omega for "O"); it is refused (strict) or becomes the default character (lossy).
    const int n = WideCharToMultiByte(CP_ACP, WC_NO_BEST_FIT_CHARS, wide.data(),
                                      static_cast<int>(wide.size()), nullptr, 0, nullptr,
                                      strict ? &usedDefault : nullptr);
    if (n <= 0 || (strict && usedDefault))
        return false;
    out.resize(static_cast<std::size_t>(n));
    return WideCharToMultiByte(CP_ACP, WC_NO_BEST_FIT_CHARS, wide.data(),
                               static_cast<int>(wide.size()), &out[0], n, nullptr, nullptr) == n;
}

std::wstring toWstring(const std::u16string& s) {
    return std::wstring(s.begin(), s.end());
}
std::u16string toU16(const std::wstring& s) {
    return std::u16string(s.begin(), s.end());
}

}  // namespace

bool narrowToUtf8(std::string_view narrow, std::string& out) {
    std::wstring wide;
    if (!ansiToWide(narrow, true, wide))
        return false;
    return utf16ToUtf8(toU16(wide), out);
}

std::string narrowToUtf8Lossy(std::string_view narrow) {
    std::wstring wide;
    ansiToWide(narrow, false, wide);
    return utf16ToUtf8Lossy(toU16(wide));
}

bool utf8ToNarrow(std::string_view utf8, std::string& out) {
    std::u16string u16;
    if (!utf8ToUtf16(utf8, u16))
        return false;
    return wideToAnsi(toWstring(u16), true, out);
}

std::string utf8ToNarrowLossy(std::string_view utf8) {
    std::string out;
    wideToAnsi(toWstring(utf8ToUtf16Lossy(utf8)), false, out);
    return out;
}

}  // namespace kov::text
