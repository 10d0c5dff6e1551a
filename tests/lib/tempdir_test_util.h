// What the tests of temporary-directory resolution through the environment share, on POSIX and
// on Windows: setting and unsetting the variables under the module's environment lock, and a
// fixture that starts every test with a fresh cache, the variables the search reads unset and a
// scratch directory of its own, and puts everything back afterwards.
#ifndef KOVPAGER_TESTS_TEMPDIR_TEST_UTIL_H
#define KOVPAGER_TESTS_TEMPDIR_TEST_UTIL_H

#include <gtest/gtest.h>

#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <mutex>
#include <shared_mutex>
#include <string>
#include <system_error>

#include "tempdir/TempDirectoryCache.h"
#include "scratch_directory.h"
#include "tempdir/TempDirectorySearch.h"

namespace kov::test {

#ifdef _WIN32
// The variables the Windows search reads, and the native separator.
inline const char* const kTempVariables[] = {"KOV_TEMP", "TEMP", "TMP"};
constexpr char kNativeSeparator = '\\';
#else
inline const char* const kTempVariables[] = {"KOV_TEMP", "TEMP", "TMP", "TMPDIR"};
constexpr char kNativeSeparator = '/';
#endif

inline void setVariable(const std::string& name, const std::string& value) {
    std::unique_lock<std::shared_mutex> lock(kov::environmentMutex());
#ifdef _WIN32
    ASSERT_EQ(::_putenv_s(name.c_str(), value.c_str()), 0);
#else
    ASSERT_EQ(::setenv(name.c_str(), value.c_str(), 1), 0);
#endif
}

inline void unsetVariable(const std::string& name) {
#ifdef _WIN32
    setVariable(name, "");  // on Windows an empty value removes the variable
#else
    std::unique_lock<std::shared_mutex> lock(kov::environmentMutex());
    ASSERT_EQ(::unsetenv(name.c_str()), 0);
#endif
}

class TempDirEnvironmentTest : public ::testing::Test {
  protected:
    void SetUp() override {
        for (const char* name : kTempVariables) {
            if (const char* value = std::getenv(name)) {
                saved_[name] = value;
            }
        }
        // The scratch directory was made with the fixture, before the variables are unset.
        base_ = scratch_.path();
        ASSERT_FALSE(base_.empty()) << "no scratch directory";
        for (const char* name : kTempVariables) {
            unsetVariable(name);
        }
        kov::tempDirectoryCache().TEST_reset();
    }

    void TearDown() override {
        for (const char* name : kTempVariables) {
            const auto found = saved_.find(name);
            if (found != saved_.end()) {
                setVariable(name, found->second);
            } else {
                unsetVariable(name);
            }
        }
        kov::tempDirectoryCache().TEST_reset();
    }

    static void removeTree(const std::string& path) {
        std::error_code ignored;
        std::filesystem::remove_all(path, ignored);
    }

    // A path under the scratch directory, in native form.
    std::string at(const std::string& relative) const {
        return base_ + kNativeSeparator + relative;
    }

    std::string makeDirectory(const std::string& relative) const {
        const std::string path = at(relative);
        std::error_code ignored;
        std::filesystem::create_directories(path, ignored);
        EXPECT_TRUE(std::filesystem::is_directory(path, ignored)) << path;
        return path;
    }

    std::string makeFile(const std::string& relative) const {
        const std::string path = at(relative);
        std::ofstream out(path);
        out << "not a directory";
        EXPECT_TRUE(out.good()) << path;
        return path;
    }

    // The variable that supplied the published directory, or empty.
    static std::string source() { return kov::tempDirectoryCache().source(); }

    // Under the platform's own temporary directory (on POSIX $TMPDIR or /tmp), lexically normal
    // and native, so that the native form of a path under it is the path itself.
    ScratchDirectory scratch_{"kov_tempdir_env_test_"};
    std::string base_;
    std::map<std::string, std::string> saved_;
};

}  // namespace kov::test

#endif  // KOVPAGER_TESTS_TEMPDIR_TEST_UTIL_H
