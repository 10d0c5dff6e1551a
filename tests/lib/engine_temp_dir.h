// The engine makes its temporary file only in the directory named by its setting
// (engine/temp_file.h), which the pager sets before it opens its engine. A test program that
// drives the engine without a pager includes this header: before its first test the setting
// names a scratch directory of the program's own (unless something set it already), and after
// its last test the setting is cleared and the directory removed. TempDirSetting points it
// elsewhere for a while.
#ifndef KOVPAGER_TESTS_ENGINE_TEMP_DIR_H
#define KOVPAGER_TESTS_ENGINE_TEMP_DIR_H

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "engine/btree.h"
#include "scratch_directory.h"

namespace kov::engine::test {

// Points the engine's temporary-directory setting at its own copy of `dir` for as long as it
// lives, then restores the previous setting.
class TempDirSetting {
  public:
    explicit TempDirSetting(const std::string& dir)
        : text_(dir), previous_(temporaryDirectorySetting()) {
        temporaryDirectorySetting() = text_.data();
    }
    ~TempDirSetting() { temporaryDirectorySetting() = previous_; }
    TempDirSetting(const TempDirSetting&) = delete;
    TempDirSetting& operator=(const TempDirSetting&) = delete;

  private:
    std::string text_;
    char* previous_;
};

class TemporaryDirectoryEnvironment : public ::testing::Environment {
  public:
    void SetUp() override {
        scratch_ = std::make_unique<kov::test::ScratchDirectory>("kov-engine-");
        path_ = scratch_->path();
        if (temporaryDirectorySetting() == nullptr && !path_.empty())
            temporaryDirectorySetting() = path_.data();
    }
    void TearDown() override {
        if (temporaryDirectorySetting() == path_.data())
            temporaryDirectorySetting() = nullptr;
        scratch_.reset();
    }

  private:
    std::unique_ptr<kov::test::ScratchDirectory> scratch_;
    std::string path_;
};

inline ::testing::Environment* const kTemporaryDirectory =
    ::testing::AddGlobalTestEnvironment(new TemporaryDirectoryEnvironment);

}  // namespace kov::engine::test

#endif  // KOVPAGER_TESTS_ENGINE_TEMP_DIR_H
