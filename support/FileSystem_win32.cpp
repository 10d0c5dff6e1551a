// The file system on Windows: every path is converted from UTF-8 to UTF-16
// (lossily, so an undecodable name never fails the conversion) and handed
// to the wide calls of the C runtime and of Win32.
#include "support/Win32Api.h"

#include <direct.h>
#include <io.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <time.h>
#include <wchar.h>

#include <filesystem>

#include "support/FileSystem.h"
#include "support/Text.h"

namespace kov::path {

PathStyle hostStyle() {
    return PathStyle::Windows;
}

}  // namespace kov::path

namespace kov::fs {
namespace {

std::wstring toWide(const std::string& utf8) {
    const std::u16string u16 = kov::text::utf8ToUtf16Lossy(utf8);
    return std::wstring(u16.begin(), u16.end());
}

std::string fromWide(const wchar_t* wide) {
    std::u16string u16;
    for (; *wide != L'\0'; ++wide)
        u16.push_back(static_cast<char16_t>(*wide));
    return kov::text::utf16ToUtf8Lossy(u16);
}

DWORD attributesOf(const std::wstring& path) {
    return GetFileAttributesW(path.c_str());
}

class Win32FileSystem final : public FileSystem {
  public:
    kov::path::PathStyle style() const override { return kov::path::PathStyle::Windows; }

    bool status(const std::string& path, Status& out) override {
        if (path.empty())
            return false;
        struct _stat64 st;
        if (_wstat64(toWide(path).c_str(), &st) != 0)
            return false;
        out.mode = static_cast<std::uint16_t>(st.st_mode);
        out.directory = (st.st_mode & _S_IFDIR) != 0;
        out.size = static_cast<std::int64_t>(st.st_size);
        out.modificationTime = static_cast<std::int64_t>(st.st_mtime);
        out.accessTime = static_cast<std::int64_t>(st.st_atime);
        out.creationTime = static_cast<std::int64_t>(st.st_ctime);
        out.device = static_cast<std::uint32_t>(st.st_dev);
        return true;
    }

    bool shareIsDirectory(const std::string& path) override {
        const DWORD a = attributesOf(toWide(path));
        return a != INVALID_FILE_ATTRIBUTES && (a & FILE_ATTRIBUTE_DIRECTORY) != 0;
    }

    bool makeDirectory(const std::string& path) override {
        return !path.empty() && _wmkdir(toWide(path).c_str()) == 0;
    }

    bool removeFile(const std::string& path) override {
        return !path.empty() && _wunlink(toWide(path).c_str()) == 0;
    }

    bool removeDirectory(const std::string& path) override {
        return !path.empty() && RemoveDirectoryW(toWide(path).c_str()) != 0;
    }

    bool isLink(const std::string& path) override {
        if (path.empty())
            return false;
        const DWORD a = attributesOf(toWide(path));
        return a != INVALID_FILE_ATTRIBUTES && (a & FILE_ATTRIBUTE_REPARSE_POINT) != 0;
    }

    bool removeLink(const std::string& path) override {
        if (path.empty())
            return false;
        const std::wstring wide = toWide(path);
        const DWORD a = attributesOf(wide);
        if (a == INVALID_FILE_ATTRIBUTES)
            return false;
        // A directory link or junction goes with RemoveDirectoryW, which
        // never touches what it points to.
        if ((a & FILE_ATTRIBUTE_DIRECTORY) != 0)
            return RemoveDirectoryW(wide.c_str()) != 0;
        return DeleteFileW(wide.c_str()) != 0;
    }

    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        if (from.empty() || to.empty())
            return false;
        return CopyFileW(toWide(from).c_str(), toWide(to).c_str(), failIfExists ? TRUE : FALSE) !=
               0;
    }

    bool moveFile(const std::string& from, const std::string& to) override {
        if (from.empty() || to.empty())
            return false;
        return MoveFileExW(toWide(from).c_str(), toWide(to).c_str(), MOVEFILE_REPLACE_EXISTING) !=
               0;
    }

    bool list(const std::string& path, std::vector<Entry>& out) override {
        if (path.empty())
            return false;
        std::wstring pattern = toWide(path);
        // A root that already ends in a backslash gets only the asterisk; a
        // second backslash would make it a network path.
        pattern += pattern.back() == L'\\' ? L"*" : L"\\*";
        WIN32_FIND_DATAW data;
        HANDLE find = FindFirstFileW(pattern.c_str(), &data);
        if (find == INVALID_HANDLE_VALUE)
            return GetLastError() == ERROR_FILE_NOT_FOUND;
        do {
            const std::string name = fromWide(data.cFileName);
            if (name == "." || name == "..")
                continue;
            out.push_back(Entry{name, (data.dwFileAttributes & FILE_ATTRIBUTE_DIRECTORY) != 0});
        } while (FindNextFileW(find, &data) != 0);
        const bool complete = GetLastError() == ERROR_NO_MORE_FILES;
        FindClose(find);
        return complete;
    }

    std::int64_t now() override { return static_cast<std::int64_t>(_time64(nullptr)); }

    void openStream(std::fstream& stream, const std::string& path,
                    std::ios_base::openmode mode) override {
        if (path.empty()) {
            stream.setstate(std::ios_base::failbit);
            return;
        }
        // The wide open of the runtime shares the file with every other
        // opener (no deny mode), as the module's files need.
        stream.open(std::filesystem::path(toWide(path)), mode);
    }
};

}  // namespace

FileSystem& hostFileSystem() {
    return everlasting<Win32FileSystem>();
}

}  // namespace kov::fs
