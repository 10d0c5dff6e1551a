// Properties of the text rules that hold for every input: the native path
// form of both styles (support/NativePath.h) and stripCharacters
// (tempdir/StripCharacters.h). Shared by the fuzz target text_rules_fuzz and
// by the regression tests of the inputs it found (support_fuzz_regression_test).
//
// checkTextRules(bytes) decodes one input and returns a description of the
// first property that does not hold, or an empty string when all hold.
//
// Input layout: byte 0 = the strip mode value (0..7, so values outside 1..3
// are covered too); byte 1 = the length L of the character set (0..7); the
// next L bytes = the set; the rest = the text (also used as the path).
#ifndef KOVPAGER_TESTS_FUZZ_TEXT_RULES_INVARIANTS_H
#define KOVPAGER_TESTS_FUZZ_TEXT_RULES_INVARIANTS_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "support/NativePath.h"
#include "tempdir/StripCharacters.h"

namespace kov::fuzz {

// Decoded input.
struct TextRulesInput {
    int mode = 0;
    std::string characters;
    std::string text;
};

inline TextRulesInput decodeTextRules(const std::uint8_t* data, std::size_t size) {
    TextRulesInput in;
    if (size == 0)
        return in;
    in.mode = data[0] & 7;
    std::size_t pos = 1;
    std::size_t setLength = size > 1 ? (data[1] & 7) : 0;
    pos = size > 1 ? 2 : 1;
    if (setLength > size - pos)
        setLength = size - pos;
    in.characters.assign(reinterpret_cast<const char*>(data + pos), setLength);
    pos += setLength;
    in.text.assign(reinterpret_cast<const char*>(data + pos), size - pos);
    return in;
}

// Encodes an input in the layout above (for seeds and regression tests).
inline std::string encodeTextRules(int mode, std::string_view characters, std::string_view text) {
    std::string out;
    out.push_back(static_cast<char>(mode & 7));
    out.push_back(static_cast<char>(characters.size() & 7));
    out.append(characters.substr(0, characters.size() & 7));
    out.append(text);
    return out;
}

namespace detail {

inline bool isSeparator(char c, path::PathStyle style) {
    return c == '/' || (style == path::PathStyle::Windows && c == '\\');
}

// The text without its separators: the native form keeps every other byte,
// in order.
inline std::string withoutSeparators(std::string_view s, path::PathStyle style) {
    std::string out;
    for (char c : s) {
        if (!isSeparator(c, style))
            out.push_back(c);
    }
    return out;
}

// The Windows native form computed run by run (a second way to the same
// rule: the library walks the text byte by byte).
inline std::string windowsRunModel(std::string_view path) {
    if (path.empty() || path == "/" || path == "\\\\")
        return std::string(path);
    std::string s(path);
    for (char& c : s) {
        if (c == '/')
            c = '\\';
    }
    while (!s.empty() && s.back() == '\\')
        s.pop_back();
    std::string out;
    std::size_t i = 0;
    while (i < s.size()) {
        if (s[i] != '\\') {
            out.push_back(s[i++]);
            continue;
        }
        std::size_t k = 0;
        while (i + k < s.size() && s[i + k] == '\\')
            ++k;
        std::size_t keep = (k + 1) / 2 + (i == 0 && k >= 2 ? 1 : 0);
        out.append(keep, '\\');
        i += k;
    }
    return out;
}

inline std::string checkPath(const std::string& text, path::PathStyle style) {
    using path::PathStyle;
    const bool windows = style == PathStyle::Windows;
    const char sep = path::separator(style);
    const std::string native = path::nativeForm(text, style);

    if (native.size() > text.size())
        return "native form is longer than the path";
    if (withoutSeparators(native, style) != withoutSeparators(text, style))
        return "native form changed a byte that is not a separator";

    // "/" stands as it is in both styles; otherwise a Windows path holds
    // no "/".
    const bool standsAsGiven = native == "/" || (windows && native == "\\\\");
    if (windows && !standsAsGiven && native.find('/') != std::string::npos)
        return "Windows native form holds a slash";

    const std::string doubled(2, sep);
    if (windows) {
        // Each pair of backslashes is replaced by one in a single pass, so
        // a run of k backslashes becomes (k + 1) / 2 of them, and a leading
        // run of two or more keeps one more (the network pair).
        if (native != windowsRunModel(text))
            return "Windows native form differs from the run-length rule";
        // Idempotent whenever nothing is left to collapse.
        if (native.find(doubled, 1) == std::string::npos &&
            path::nativeForm(native, style) != native)
            return "Windows native form without doubled separators is not idempotent";
    } else {
        if (path::nativeForm(native, style) != native)
            return "POSIX native form is not idempotent";
        if (native.find(doubled) != std::string::npos)
            return "POSIX native form holds a doubled separator";
    }

    // No trailing separator, except the root.
    if (!native.empty() && native.back() == sep && !standsAsGiven)
        return "native form ends with a separator";

    // The portable form is the native form with "/" for every separator.
    std::string portable = native;
    for (char& c : portable) {
        if (c == sep)
            c = '/';
    }
    if (path::portableForm(text, style) != portable)
        return "portable form differs from the native form with slashes";

    // Splitting into components and joining them again gives the native
    // form back ("/" on Windows style is the one path that splits into a
    // root record of another spelling).
    const std::vector<std::string> parts = path::splitNative(native, style);
    if (native.empty() != parts.empty())
        return "split of a non-empty path gave no component, or the reverse";
    std::string joined;
    for (std::size_t i = 0; i < parts.size(); ++i) {
        if (parts[i].empty())
            return "split gave an empty component";
        if (i > 0 && parts[i].find(sep) != std::string::npos)
            return "a component after the first holds a separator";
        if (i > 0 && path::rootKindOf(parts[i], style) == path::kSeparatorRoot)
            return "a separator root after the first component";
        joined = i == 0 ? parts[i] : path::joinComponent(joined, parts[i], style);
    }
    // (A doubled separator left inside a Windows path, from a run of three
    // or more backslashes, splits into no empty component: the join then
    // writes it once, so such paths are left out here.)
    const bool collapsible = windows && native.find(doubled, 1) != std::string::npos;
    if (!(windows && native == "/") && !collapsible && joined != native)
        return "joining the components does not give the native form back";
    if (!parts.empty()) {
        // Root kinds and presumed roots agree on the first component.
        const int kind = path::rootKindOf(parts[0], style);
        const bool presumed = path::isPresumedRoot(parts[0], style);
        if (presumed && kind == path::kNotRoot)
            return "a presumed root with no root kind";
        if (path::isDriveName(parts[0]) !=
            (parts[0].size() == 2 && parts[0][1] == ':' &&
             ((parts[0][0] | 0x20) >= 'a' && (parts[0][0] | 0x20) <= 'z')))
            return "drive name test disagrees with letter-colon";
    }
    return std::string();
}

inline bool inSet(char c, const std::string& set) {
    return set.find(c) != std::string::npos;
}

inline std::string checkStrip(const TextRulesInput& in) {
    const std::string& text = in.text;
    const std::string& set = in.characters;
    const std::string lead = stripCharacters(text, set, StripMode::leading);
    const std::string trail = stripCharacters(text, set, StripMode::trailing);
    const std::string both = stripCharacters(text, set, StripMode::both);

    if (set.empty() || text.empty()) {
        if (lead != text || trail != text || both != text)
            return "strip with an empty text or set changed the text";
    }
    // Leading strips a prefix, trailing a suffix, both one of each, and only
    // bytes of the set.
    if (lead.size() > text.size() ||
        text.compare(text.size() - lead.size(), lead.size(), lead) != 0)
        return "leading strip result is not a suffix of the text";
    if (trail.size() > text.size() || text.compare(0, trail.size(), trail) != 0)
        return "trailing strip result is not a prefix of the text";
    if (both.size() > text.size() || text.find(both) == std::string::npos)
        return "both-ends strip result is not a substring of the text";
    for (std::size_t i = 0; i < text.size() - lead.size(); ++i) {
        if (!inSet(text[i], set))
            return "leading strip removed a byte outside the set";
    }
    for (std::size_t i = trail.size(); i < text.size(); ++i) {
        if (!inSet(text[i], set))
            return "trailing strip removed a byte outside the set";
    }
    // And as much as it can.
    if (!set.empty() && !lead.empty() && inSet(lead.front(), set))
        return "leading strip left a set byte at the front";
    if (!set.empty() && !trail.empty() && inSet(trail.back(), set))
        return "trailing strip left a set byte at the end";
    if (!set.empty() && !both.empty() && (inSet(both.front(), set) || inSet(both.back(), set)))
        return "both-ends strip left a set byte at an end";

    // Both ends is trailing after leading, and leading after trailing.
    if (stripCharacters(lead, set, StripMode::trailing) != both)
        return "trailing after leading differs from both";
    if (stripCharacters(trail, set, StripMode::leading) != both)
        return "leading after trailing differs from both";
    // Stripping again changes nothing.
    if (stripCharacters(both, set, StripMode::both) != both)
        return "both-ends strip is not idempotent";

    // Any mode value: its two low bits choose the ends.
    const std::string any = stripCharacters(text, set, static_cast<StripMode>(in.mode));
    const int bits = in.mode & 3;
    const std::string& expected = bits == 0 ? text : bits == 1 ? lead : bits == 2 ? trail : both;
    if (any != expected)
        return "a mode value's two low bits do not choose the ends";
    return std::string();
}

}  // namespace detail

inline std::string checkTextRules(const std::uint8_t* data, std::size_t size) {
    const TextRulesInput in = decodeTextRules(data, size);
    std::string failure = detail::checkStrip(in);
    if (!failure.empty())
        return "stripCharacters: " + failure;
    failure = detail::checkPath(in.text, path::PathStyle::Posix);
    if (!failure.empty())
        return "POSIX style: " + failure;
    failure = detail::checkPath(in.text, path::PathStyle::Windows);
    if (!failure.empty())
        return "Windows style: " + failure;
    return std::string();
}

inline std::string checkTextRules(std::string_view input) {
    return checkTextRules(reinterpret_cast<const std::uint8_t*>(input.data()), input.size());
}

}  // namespace kov::fuzz

#endif  // KOVPAGER_TESTS_FUZZ_TEXT_RULES_INVARIANTS_H
