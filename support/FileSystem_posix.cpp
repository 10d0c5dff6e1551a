// The file system on POSIX: paths are byte strings passed to the system as
// they are.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <ctime>

#include "support/FileSystem.h"

namespace kov::path {

PathStyle hostStyle() {
    return PathStyle::Posix;
}

}  // namespace kov::path

namespace kov::fs {
namespace {

// Closes a descriptor when it goes out of scope.
class Descriptor {
  public:
    explicit Descriptor(int fd) : fd_(fd) {}
    ~Descriptor() {
        if (fd_ >= 0)
            ::close(fd_);
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    int get() const { return fd_; }

  private:
    int fd_;  // -1 when none
};

// Writes all of `n` bytes, retrying on interruption.
bool writeAll(int fd, const char* data, std::size_t n) {
    while (n > 0) {
        const ssize_t w = ::write(fd, data, n);
        if (w < 0) {
            if (errno == EINTR)
                continue;
            return false;
        }
        data += w;
        n -= static_cast<std::size_t>(w);
    }
    return true;
}

class PosixFileSystem final : public FileSystem {
  public:
    kov::path::PathStyle style() const override { return kov::path::PathStyle::Posix; }

    bool status(const std::string& path, Status& out) override {
        struct stat st;
        if (path.empty() || ::stat(path.c_str(), &st) != 0)
            return false;
        out.mode = static_cast<std::uint16_t>(st.st_mode);
        out.directory = S_ISDIR(st.st_mode);
        out.size = static_cast<std::int64_t>(st.st_size);
        out.modificationTime = static_cast<std::int64_t>(st.st_mtime);
        out.accessTime = static_cast<std::int64_t>(st.st_atime);
        out.creationTime = static_cast<std::int64_t>(st.st_ctime);
        out.device = static_cast<std::uint32_t>(st.st_dev);
        return true;
    }

    bool shareIsDirectory(const std::string&) override { return false; }

    bool makeDirectory(const std::string& path) override {
        return !path.empty() && ::mkdir(path.c_str(), 0777) == 0;
    }

    bool removeFile(const std::string& path) override {
        return !path.empty() && ::unlink(path.c_str()) == 0;
    }

    bool removeDirectory(const std::string& path) override {
        return !path.empty() && ::rmdir(path.c_str()) == 0;
    }

    bool isLink(const std::string& path) override {
        struct stat st;
        return !path.empty() && ::lstat(path.c_str(), &st) == 0 && S_ISLNK(st.st_mode);
    }

    bool removeLink(const std::string& path) override { return removeFile(path); }

    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        if (from.empty() || to.empty())
            return false;
        Descriptor in(::open(from.c_str(), O_RDONLY | O_CLOEXEC));
        if (in.get() < 0)
            return false;
        struct stat src;
        if (::fstat(in.get(), &src) != 0 || !S_ISREG(src.st_mode))
            return false;
        const int flags = O_WRONLY | O_CREAT | O_CLOEXEC | (failIfExists ? O_EXCL : 0);
        Descriptor out(::open(to.c_str(), flags, src.st_mode & 0777));
        if (out.get() < 0)
            return false;
        // Copying a file onto itself would truncate it: refuse before truncating.
        struct stat dst;
        if (::fstat(out.get(), &dst) != 0 || (dst.st_dev == src.st_dev && dst.st_ino == src.st_ino))
            return false;
        if (::ftruncate(out.get(), 0) != 0)
            return false;
        char buffer[64 * 1024];
        for (;;) {
            const ssize_t r = ::read(in.get(), buffer, sizeof buffer);
            if (r == 0)
                break;
            if (r < 0) {
                if (errno == EINTR)
                    continue;
                return false;
            }
            if (!writeAll(out.get(), buffer, static_cast<std::size_t>(r)))
                return false;
        }
        // Keep the source's modification time, as a copy on Windows does.
        struct timespec times[2] = {src.st_atim, src.st_mtim};
        ::futimens(out.get(), times);
        return true;
    }

    bool moveFile(const std::string& from, const std::string& to) override {
        return !from.empty() && !to.empty() && ::rename(from.c_str(), to.c_str()) == 0;
    }

    bool list(const std::string& path, std::vector<Entry>& out) override {
        if (path.empty())
            return false;
        DIR* dir = ::opendir(path.c_str());
        if (dir == nullptr)
            return false;
        for (;;) {
            errno = 0;
            const struct dirent* e = ::readdir(dir);
            if (e == nullptr)
                break;
            const std::string name(e->d_name);
            if (name == "." || name == "..")
                continue;
            bool directory = e->d_type == DT_DIR;
            if (e->d_type == DT_UNKNOWN) {
                struct stat st;
                directory = ::fstatat(::dirfd(dir), e->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                            S_ISDIR(st.st_mode);
            }
            out.push_back(Entry{name, directory});
        }
        const bool ok = errno == 0;
        ::closedir(dir);
        return ok;
    }

    std::int64_t now() override { return static_cast<std::int64_t>(std::time(nullptr)); }

    void openStream(std::fstream& stream, const std::string& path,
                    std::ios_base::openmode mode) override {
        if (path.empty()) {
            stream.setstate(std::ios_base::failbit);
            return;
        }
        stream.open(path.c_str(), mode);
    }
};

}  // namespace

FileSystem& hostFileSystem() {
    return everlasting<PosixFileSystem>();
}

}  // namespace kov::fs
