// The module's shared text constants. They are constexpr views of string
// literals: nothing is built, allocated or registered for them when the
// library loads, and nothing needs tearing down when it unloads.
//
// Only the path separator is read inside the library: the path text rules
// (support/NativePath.cpp, separator()) take it as the separator of Windows
// paths, where they split a path into its parts, join a directory and an
// entry name, and recognise a network prefix. The other names are part of
// the family of programs this library ships with; they are kept here so every
// program names them alike.
#ifndef KOVPAGER_SUPPORT_MODULECONSTANTS_H
#define KOVPAGER_SUPPORT_MODULECONSTANTS_H

#include <string_view>

namespace kov::constants {

// Environment and key names.
constexpr std::string_view kManifestDir = "KOV_MF_DIR";
constexpr std::string_view kManifestName = "KOV_MF_NAME";
constexpr std::string_view kSharedResourceDir = "KOV_SHARED_RESOURCE_DIR";
constexpr std::string_view kSharedResourceDirDirective = "KOV_SHARED_RESOURCE_DIR_DIRECTIVE";
constexpr std::string_view kHome = "KOV_HOME";

// Call-pattern texts; plain text here, compiled by whoever matches with them.
constexpr std::string_view kCallPattern = "@[a-zA-Z0-9.]+(";
constexpr std::string_view kLeadingCallPattern = "^@[a-zA-Z0-9.]+(";

// Temporary-name templates.
constexpr std::string_view kTempTemplate = "XXXXXX";
constexpr std::string_view kKovTempTemplate = "KOV_XXXXXX";

// Boolean words.
constexpr std::string_view kTrue = "true";
constexpr std::string_view kFalse = "false";

// Message names.
constexpr std::string_view kGuiFailed = "KOVGUI_Failed";
constexpr std::string_view kGuiSuccessful = "KOVGUI_Successful";
constexpr std::string_view kViewDrawDone = "KOVView_DrawDone";
constexpr std::string_view kViewLoadDone = "KOVView_LoadDone";
constexpr std::string_view kWbBreakpointHit = "KOVWB_BreakpointHit";
constexpr std::string_view kWbCopy = "KOVWB_Copy";
constexpr std::string_view kWbCut = "KOVWB_Cut";
constexpr std::string_view kWbDelete = "KOVWB_Delete";
constexpr std::string_view kWbInsert = "KOVWB_Insert";
constexpr std::string_view kWbPaste = "KOVWB_Paste";
constexpr std::string_view kWbXlatFailed = "KOVWB_XLatFailed";
constexpr std::string_view kWbXlatSuccessful = "KOVWB_XlatSuccessful";

// Folder names.
constexpr std::string_view kDatasourcesFolder = "My KOV Datasources";
constexpr std::string_view kDatasourcesSubfolder = "datasources";

// The separator of Windows paths (POSIX paths use '/'), read through
// kov::path::separator().
constexpr std::string_view kPathSeparator = "\\";

}  // namespace kov::constants

#endif  // KOVPAGER_SUPPORT_MODULECONSTANTS_H
