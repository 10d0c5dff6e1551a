// Path text rules of both styles; hostStyle() is defined by the platform
// file (FileSystem_posix.cpp / FileSystem_win32.cpp).
#include "support/NativePath.h"

#include "support/ModuleConstants.h"

namespace kov::path {
namespace {

bool isAsciiLetter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}

// Windows: "/" -> "\", trailing "\" stripped, each pair of "\" replaced by
// one (left to right, a single pass), a leading pair kept.
std::string windowsForm(std::string_view path) {
    if (path.empty() || path == "/" || path == "\\\\")
        return std::string(path);
    std::string s(path);
    for (char& c : s) {
        if (c == '/')
            c = '\\';
    }
    while (!s.empty() && s.back() == '\\')
        s.pop_back();
    const bool network = s.size() >= 2 && s[0] == '\\' && s[1] == '\\';
    std::string out;
    out.reserve(s.size() + 1);
    if (network)
        out.push_back('\\');
    for (std::size_t i = 0; i < s.size(); ++i) {
        out.push_back(s[i]);
        if (s[i] == '\\' && i + 1 < s.size() && s[i + 1] == '\\')
            ++i;
    }
    return out;
}

// POSIX: runs of "/" collapse to one; trailing "/" stripped except for "/".
std::string posixForm(std::string_view path) {
    std::string out;
    out.reserve(path.size());
    for (char c : path) {
        if (c == '/' && !out.empty() && out.back() == '/')
            continue;
        out.push_back(c);
    }
    if (out.size() > 1 && out.back() == '/')
        out.pop_back();
    return out;
}

}  // namespace

std::string nativeForm(std::string_view path, PathStyle style) {
    return style == PathStyle::Windows ? windowsForm(path) : posixForm(path);
}

char separator(PathStyle style) {
    return style == PathStyle::Windows ? kov::constants::kPathSeparator.front() : '/';
}

bool isDriveName(std::string_view name) {
    return name.size() == 2 && isAsciiLetter(name[0]) && name[1] == ':';
}

int rootKindOf(std::string_view name, PathStyle style) {
    if (name == ".")
        return kDotRoot;
    if (style == PathStyle::Windows) {
        if (name == "\\" || name == "\\\\")
            return kSeparatorRoot;
        if (isDriveName(name))
            return kDriveRoot;
        return kNotRoot;
    }
    return name == "/" ? kSeparatorRoot : kNotRoot;
}

bool isPresumedRoot(std::string_view name, PathStyle style) {
    if (name == ".")
        return true;
    if (style == PathStyle::Windows)
        return isDriveName(name) || name == "\\\\";
    return name == "/";
}

std::vector<std::string> splitNative(std::string_view native, PathStyle style) {
    std::vector<std::string> parts;
    if (native.empty())
        return parts;
    const char sep = separator(style);
    std::size_t pos = 0;
    if (style == PathStyle::Windows) {
        if (native == "/")
            return {"\\"};
        if (native.size() >= 2 && native[0] == '\\' && native[1] == '\\') {
            parts.emplace_back("\\\\");
            pos = 2;
        } else if (native[0] == '\\') {
            parts.emplace_back("\\");
            pos = 1;
        }
    } else if (native[0] == '/') {
        parts.emplace_back("/");
        pos = 1;
    }
    while (pos < native.size()) {
        std::size_t end = native.find(sep, pos);
        if (end == std::string_view::npos)
            end = native.size();
        if (end > pos)
            parts.emplace_back(native.substr(pos, end - pos));
        pos = end + 1;
    }
    return parts;
}

std::string joinComponent(std::string_view parent, std::string_view name, PathStyle style) {
    std::string out(parent);
    const char sep = separator(style);
    if (!out.empty() && out.back() != sep)
        out.push_back(sep);
    out.append(name.data(), name.size());
    return out;
}

std::string portableForm(std::string_view path, PathStyle style) {
    std::string out = nativeForm(path, style);
    if (style == PathStyle::Windows) {
        for (char& c : out) {
            if (c == '\\')
                c = '/';
        }
    }
    return out;
}

}  // namespace kov::path
