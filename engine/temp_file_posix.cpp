// The temporary-file layer's system calls on POSIX (engine/temp_file_os.h).
#include "engine/temp_file_os.h"

#include <cerrno>
#include <cstring>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

// After the system headers: SQLite's result codes.
#include "engine/private_sqlite3.h"

namespace kov::engine::tempfile {

namespace {

// ENOSPC, and a user's quota that is used up, are a full disk.
bool isFull(int err) { return err == ENOSPC || err == EDQUOT || err == EFBIG; }

int failWith(int code, const char* doing, int err, std::string* error) {
    *error = std::string(doing) + ": " + std::strerror(err);
    return code;
}

}  // namespace

int create(const std::string& directory, const std::string& name, Handle* out, bool* exists,
           std::string* error) {
    *exists = false;
    const std::string path = directory + "/" + name;
    int fd = -1;
    do {
        // O_EXCL with O_CREAT also refuses a symbolic link at the name, dangling or not;
        // O_NOFOLLOW says so twice. 0600: the process's user only (the umask can only take away).
        fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        *exists = errno == EEXIST;
        return failWith(SQLITE_CANTOPEN, ("cannot make a file in " + directory).c_str(), errno,
                        error);
    }
    if (::unlink(path.c_str()) != 0) {
        // A file that cannot leave the directory would outlive a crash: not taken.
        const int err = errno;
        ::close(fd);
        return failWith(SQLITE_CANTOPEN, ("cannot unlink a new file in " + directory).c_str(), err,
                        error);
    }
    *out = fd;
    return SQLITE_OK;
}

int readAt(Handle file, void* buffer, int amount, std::int64_t offset, int* got,
           std::string* error) {
    auto* at = static_cast<char*>(buffer);
    int done = 0;
    while (done < amount) {
        const ssize_t n = ::pread(static_cast<int>(file), at + done,
                                  static_cast<std::size_t>(amount - done), offset + done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return failWith(SQLITE_IOERR_READ, "cannot read the temporary file", errno, error);
        if (n == 0)
            break;  // the end of the file
        done += static_cast<int>(n);
    }
    *got = done;
    return SQLITE_OK;
}

int writeAt(Handle file, const void* buffer, int amount, std::int64_t offset, std::string* error) {
    const auto* at = static_cast<const char*>(buffer);
    int done = 0;
    while (done < amount) {
        const ssize_t n = ::pwrite(static_cast<int>(file), at + done,
                                   static_cast<std::size_t>(amount - done), offset + done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            const int err = n < 0 ? errno : ENOSPC;
            return failWith(isFull(err) ? SQLITE_FULL : SQLITE_IOERR_WRITE,
                            "cannot write the temporary file", err, error);
        }
        done += static_cast<int>(n);
    }
    return SQLITE_OK;
}

int reserve(Handle file, std::int64_t from, std::int64_t to, std::string* error) {
    int err = 0;
    do {
        // posix_fallocate returns the error instead of setting errno.
        err = ::posix_fallocate(static_cast<int>(file), from, to - from);
    } while (err == EINTR);
    if (err == 0)
        return SQLITE_OK;
    return failWith(isFull(err) ? SQLITE_FULL : SQLITE_IOERR_WRITE,
                    "cannot reserve space for the temporary file", err, error);
}

int release(Handle file, std::int64_t keep, std::string* error) {
    // The room was taken by making the file longer: shortening it gives the blocks back.
    std::int64_t now = 0;
    int rc = size(file, &now, error);
    if (rc != SQLITE_OK || now <= keep)
        return rc == SQLITE_OK ? SQLITE_OK : SQLITE_IOERR_TRUNCATE;
    return truncate(file, keep, error);
}

int size(Handle file, std::int64_t* out, std::string* error) {
    struct stat st {};
    if (::fstat(static_cast<int>(file), &st) != 0)
        return failWith(SQLITE_IOERR_FSTAT, "cannot read the temporary file's size", errno, error);
    *out = static_cast<std::int64_t>(st.st_size);
    return SQLITE_OK;
}

int truncate(Handle file, std::int64_t size, std::string* error) {
    int rc = 0;
    do {
        rc = ::ftruncate(static_cast<int>(file), static_cast<off_t>(size));
    } while (rc != 0 && errno == EINTR);
    if (rc != 0)
        return failWith(SQLITE_IOERR_TRUNCATE, "cannot truncate the temporary file", errno, error);
    return SQLITE_OK;
}

void close(Handle file) { ::close(static_cast<int>(file)); }

}  // namespace kov::engine::tempfile
