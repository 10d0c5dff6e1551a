// A fresh, empty directory for one test, on every platform.
//
//   kov::test::ScratchDirectory scratch("kov-engine-large-");
//   ASSERT_FALSE(scratch.path().empty());
//   ... files under scratch.path() ...
//
// It is made under the system's temporary path (std::filesystem::temp_directory_path: $TMPDIR or
// /tmp on POSIX, GetTempPath on Windows) with the given prefix and a random number, and removed
// with everything in it when the object goes. path() is lexically normal and in native form
// (backslashes on Windows), or empty when no directory could be made.
#ifndef KOVPAGER_TESTS_SCRATCH_DIRECTORY_H
#define KOVPAGER_TESTS_SCRATCH_DIRECTORY_H

#include <filesystem>
#include <random>
#include <string>
#include <system_error>

namespace kov::test {

class ScratchDirectory {
  public:
    explicit ScratchDirectory(const std::string& prefix) {
        namespace fs = std::filesystem;
        std::error_code ec;
        const fs::path base = fs::temp_directory_path(ec);
        std::random_device random;
        for (int attempt = 0; !ec && attempt < 100 && path_.empty(); ++attempt) {
            const fs::path candidate =
                (base / (prefix + std::to_string(random()) + std::to_string(random())))
                    .lexically_normal()
                    .make_preferred();
            std::error_code made;
            if (fs::create_directory(candidate, made) && !made)
                path_ = candidate.string();
        }
    }
    ~ScratchDirectory() {
        std::error_code ignored;
        if (!path_.empty())
            std::filesystem::remove_all(path_, ignored);
    }
    ScratchDirectory(const ScratchDirectory&) = delete;
    ScratchDirectory& operator=(const ScratchDirectory&) = delete;

    const std::string& path() const { return path_; }

  private:
    std::string path_;
};

// The path of a directory that existed a moment ago and exists no more (made and removed at
// once): a temporary directory removed since it was chosen. Empty when none could be made.
inline std::string vanishedDirectory(const std::string& prefix) {
    return ScratchDirectory(prefix).path();
}

}  // namespace kov::test

#endif  // KOVPAGER_TESTS_SCRATCH_DIRECTORY_H
