// Path text rules, as pure functions of the text so that the rules of both
// platforms are checked everywhere.
//
// Windows style: "/" becomes "\"; trailing backslashes are stripped; each
// pair of backslashes is replaced by one, in a single pass from the left, so
// a run of k backslashes becomes (k + 1) / 2 of them (two become one, three
// and four become two): a run is not collapsed to one. A leading run keeps
// one more, so that the pair of a network path survives. The empty path, "/"
// and "\\" stand as they are.
//   "a//b/" -> "a\b"      "\\\\srv\\share\\" -> "\\srv\share"
//
// POSIX style: "/" is the only separator and a backslash is an ordinary
// name character; runs of slashes collapse; trailing slashes are stripped
// except for the root "/".
//   "a//b/" -> "a/b"      "///" -> "/"      "a\\b" stays "a\\b"
//
// A native path splits into components, one per path record, the first of
// which may be a root record (see rootRecordKind).
#ifndef KOVPAGER_SUPPORT_NATIVEPATH_H
#define KOVPAGER_SUPPORT_NATIVEPATH_H

#include <string>
#include <string_view>
#include <vector>

namespace kov::path {

enum class PathStyle { Posix, Windows };

// The style of the platform we run on (chosen when the library is built).
PathStyle hostStyle();

// The native form of `path` in `style`.
std::string nativeForm(std::string_view path, PathStyle style);

// The separator of `style`: '\\' or '/'.
char separator(PathStyle style);

// Kinds of the first record of a path chain.
enum RootKind : int {
    kNotRoot = 0,        // an ordinary name
    kSeparatorRoot = 1,  // Windows "\" or "\\" (network prefix); POSIX "/"
    kDotRoot = 2,        // "."
    kDriveRoot = 3,      // Windows "X:" (an ASCII letter of either case and ':')
};

// The root kind of a first component named `name`.
int rootKindOf(std::string_view name, PathStyle style);

// True when a record named `name` is made read and existing at once, with no
// status query: ".", a drive "X:" and the network prefix "\\" (Windows), or
// "." and "/" (POSIX).
bool isPresumedRoot(std::string_view name, PathStyle style);

// True when `name` is a drive, an ASCII letter followed by ':'.
bool isDriveName(std::string_view name);

// Splits a native path into its components. A leading separator (or the
// Windows network pair) becomes a component of its own: "/a/b" -> {"/",
// "a", "b"}; "\\\\srv\\s" -> {"\\\\", "srv", "s"}; "\\a" -> {"\\", "a"}.
// The empty path gives no component.
std::vector<std::string> splitNative(std::string_view native, PathStyle style);

// Joins a parent's full path and a component name: with one separator
// between them unless the parent already ends with one.
std::string joinComponent(std::string_view parent, std::string_view name, PathStyle style);

// The portable form: the native form with every separator written "/".
std::string portableForm(std::string_view path, PathStyle style);

}  // namespace kov::path

#endif  // KOVPAGER_SUPPORT_NATIVEPATH_H
