// The temporary-file layer's system calls on Windows (engine/temp_file_os.h).
#include "engine/temp_file_os.h"

#include <cstdio>

#include "support/Text.h"
#include "support/Win32Api.h"

#include <sddl.h>

// After the system headers: SQLite's result codes.
#include "engine/private_sqlite3.h"

namespace kov::engine::tempfile {

namespace {

HANDLE handleOf(Handle file) { return reinterpret_cast<HANDLE>(file); }

bool isFull(DWORD err) { return err == ERROR_DISK_FULL || err == ERROR_HANDLE_DISK_FULL; }

std::string systemText(DWORD err) {
    char* text = nullptr;
    const DWORD n = ::FormatMessageA(
        FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
        nullptr, err, 0, reinterpret_cast<char*>(&text), 0, nullptr);
    std::string out;
    if (n != 0 && text != nullptr) {
        out.assign(text, n);
        while (!out.empty() && (out.back() == '\n' || out.back() == '\r' || out.back() == '.'))
            out.pop_back();
    } else {
        char code[32];
        std::snprintf(code, sizeof code, "system error %lu", static_cast<unsigned long>(err));
        out = code;
    }
    if (text != nullptr)
        ::LocalFree(text);
    return out;
}

int failWith(int code, const std::string& doing, DWORD err, std::string* error) {
    *error = doing + ": " + systemText(err);
    return code;
}

// A security descriptor that gives the process's user full access and no one else any: the
// user's SID, in text, in a protected access list.
class OwnerOnly {
  public:
    OwnerOnly() {
        HANDLE token = nullptr;
        if (!::OpenProcessToken(::GetCurrentProcess(), TOKEN_QUERY, &token))
            return;
        DWORD size = 0;
        ::GetTokenInformation(token, TokenUser, nullptr, 0, &size);
        std::string buffer(size, '\0');
        LPWSTR sid = nullptr;
        if (size != 0 &&
            ::GetTokenInformation(token, TokenUser, buffer.data(), size, &size) &&
            ::ConvertSidToStringSidW(reinterpret_cast<TOKEN_USER*>(buffer.data())->User.Sid,
                                     &sid)) {
            const std::wstring sddl = std::wstring(L"D:P(A;;FA;;;") + sid + L")";
            ::ConvertStringSecurityDescriptorToSecurityDescriptorW(
                sddl.c_str(), SDDL_REVISION_1, &descriptor_, nullptr);
            ::LocalFree(sid);
        }
        ::CloseHandle(token);
    }
    ~OwnerOnly() {
        if (descriptor_ != nullptr)
            ::LocalFree(descriptor_);
    }
    OwnerOnly(const OwnerOnly&) = delete;
    OwnerOnly& operator=(const OwnerOnly&) = delete;

    bool ok() const { return descriptor_ != nullptr; }
    PSECURITY_DESCRIPTOR descriptor() const { return descriptor_; }

  private:
    PSECURITY_DESCRIPTOR descriptor_ = nullptr;
};

OVERLAPPED at(std::int64_t offset) {
    OVERLAPPED o{};
    o.Offset = static_cast<DWORD>(static_cast<std::uint64_t>(offset) & 0xffffffffu);
    o.OffsetHigh = static_cast<DWORD>(static_cast<std::uint64_t>(offset) >> 32);
    return o;
}

}  // namespace

int create(const std::string& directory, const std::string& name, Handle* out, bool* exists,
           std::string* error) {
    *exists = false;
    const std::string doing = "cannot make a file in " + directory;
    const std::u16string wide =
        kov::text::utf8ToUtf16Lossy(kov::text::narrowToUtf8Lossy(directory + "\\" + name));
    OwnerOnly owner;
    if (!owner.ok())
        return failWith(SQLITE_CANTOPEN, doing, ::GetLastError(), error);
    SECURITY_ATTRIBUTES security{};
    security.nLength = sizeof security;
    security.lpSecurityDescriptor = owner.descriptor();
    security.bInheritHandle = FALSE;
    // CREATE_NEW refuses an existing name, a link included; no sharing: no other opener while
    // the store has it; deleted when the store closes it.
    HANDLE h = ::CreateFileW(reinterpret_cast<LPCWSTR>(wide.c_str()), GENERIC_READ | GENERIC_WRITE,
                             0, &security, CREATE_NEW,
                             FILE_ATTRIBUTE_TEMPORARY | FILE_ATTRIBUTE_HIDDEN |
                                 FILE_FLAG_DELETE_ON_CLOSE | FILE_FLAG_OPEN_REPARSE_POINT,
                             nullptr);
    if (h == INVALID_HANDLE_VALUE) {
        const DWORD err = ::GetLastError();
        *exists = err == ERROR_FILE_EXISTS || err == ERROR_ALREADY_EXISTS;
        return failWith(SQLITE_CANTOPEN, doing, err, error);
    }
    *out = reinterpret_cast<Handle>(h);
    return SQLITE_OK;
}

int readAt(Handle file, void* buffer, int amount, std::int64_t offset, int* got,
           std::string* error) {
    auto* to = static_cast<char*>(buffer);
    int done = 0;
    while (done < amount) {
        OVERLAPPED o = at(offset + done);
        DWORD n = 0;
        if (!::ReadFile(handleOf(file), to + done, static_cast<DWORD>(amount - done), &n, &o)) {
            const DWORD err = ::GetLastError();
            if (err == ERROR_HANDLE_EOF)
                break;
            return failWith(SQLITE_IOERR_READ, "cannot read the temporary file", err, error);
        }
        if (n == 0)
            break;
        done += static_cast<int>(n);
    }
    *got = done;
    return SQLITE_OK;
}

int writeAt(Handle file, const void* buffer, int amount, std::int64_t offset, std::string* error) {
    const auto* from = static_cast<const char*>(buffer);
    int done = 0;
    while (done < amount) {
        OVERLAPPED o = at(offset + done);
        DWORD n = 0;
        if (!::WriteFile(handleOf(file), from + done, static_cast<DWORD>(amount - done), &n, &o) ||
            n == 0) {
            const DWORD err = n == 0 && ::GetLastError() == ERROR_SUCCESS ? ERROR_DISK_FULL
                                                                          : ::GetLastError();
            return failWith(isFull(err) ? SQLITE_FULL : SQLITE_IOERR_WRITE,
                            "cannot write the temporary file", err, error);
        }
        done += static_cast<int>(n);
    }
    return SQLITE_OK;
}

// (An allocation size counts from the start of the file: `from` is not needed.)
int reserve(Handle file, std::int64_t /*from*/, std::int64_t to, std::string* error) {
    // The allocation size holds room past the end of the file without moving the end (data
    // written there later needs no zero-filling first).
    FILE_ALLOCATION_INFO info{};
    info.AllocationSize.QuadPart = to;
    if (::SetFileInformationByHandle(handleOf(file), FileAllocationInfo, &info, sizeof info))
        return SQLITE_OK;
    DWORD err = ::GetLastError();
    if (!isFull(err)) {
        // A file system (or a Windows layer) that does not take an allocation size: moving the
        // end of the file allocates the room as well. Never below the current end.
        LARGE_INTEGER end{};
        if (::GetFileSizeEx(handleOf(file), &end) && end.QuadPart >= to)
            return SQLITE_OK;
        FILE_END_OF_FILE_INFO eof{};
        eof.EndOfFile.QuadPart = to;
        if (::SetFileInformationByHandle(handleOf(file), FileEndOfFileInfo, &eof, sizeof eof))
            return SQLITE_OK;
        err = ::GetLastError();
    }
    return failWith(isFull(err) ? SQLITE_FULL : SQLITE_IOERR_WRITE,
                    "cannot reserve space for the temporary file", err, error);
}

int release(Handle file, std::int64_t keep, std::string* error) {
    // An allocation size past the end gives its room back when set lower; an end moved out to
    // hold room (the fallback above) is moved back.
    LARGE_INTEGER end{};
    if (::GetFileSizeEx(handleOf(file), &end) && end.QuadPart > keep)
        return truncate(file, keep, error);
    FILE_ALLOCATION_INFO info{};
    info.AllocationSize.QuadPart = keep;
    ::SetFileInformationByHandle(handleOf(file), FileAllocationInfo, &info, sizeof info);
    return SQLITE_OK;
}

int size(Handle file, std::int64_t* out, std::string* error) {
    LARGE_INTEGER n{};
    if (!::GetFileSizeEx(handleOf(file), &n))
        return failWith(SQLITE_IOERR_FSTAT, "cannot read the temporary file's size",
                        ::GetLastError(), error);
    *out = n.QuadPart;
    return SQLITE_OK;
}

int truncate(Handle file, std::int64_t size, std::string* error) {
    FILE_END_OF_FILE_INFO info{};
    info.EndOfFile.QuadPart = size;
    if (!::SetFileInformationByHandle(handleOf(file), FileEndOfFileInfo, &info, sizeof info))
        return failWith(SQLITE_IOERR_TRUNCATE, "cannot truncate the temporary file",
                        ::GetLastError(), error);
    return SQLITE_OK;
}

void close(Handle file) { ::CloseHandle(handleOf(file)); }

}  // namespace kov::engine::tempfile
