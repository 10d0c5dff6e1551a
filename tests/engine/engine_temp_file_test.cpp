// The temporary-file layer (engine/temp_file.h), driven the way SQLite drives it: a file without
// a name is made in the directory of the engine's setting and nowhere else, reads and writes go
// through, room is reserved on request, and a directory that cannot take the file refuses it and
// says why.
#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "engine/private_sqlite3.h"
#include "engine/sqlite_btree.h"
#include "engine/temp_file.h"
#include "engine_temp_dir.h"
#include "host_util.h"
#include "scratch_directory.h"

namespace {

using kov::engine::temporaryDirectorySetting;
using kov::engine::test::TempDirSetting;

// A file of the layer, opened as SQLite opens a temporary database.
class LayerFile {
  public:
    LayerFile() {
        EXPECT_TRUE(kov::engine::installTemporaryFiles());
        vfs_ = sqlite3_vfs_find(kov::engine::kTemporaryFileLayer);
        memory_.resize(static_cast<std::size_t>(vfs_->szOsFile) + 16);
        rc = vfs_->xOpen(vfs_, nullptr, file(), kFlags, &outFlags);
    }
    ~LayerFile() { close(); }
    LayerFile(const LayerFile&) = delete;
    LayerFile& operator=(const LayerFile&) = delete;

    sqlite3_file* file() { return reinterpret_cast<sqlite3_file*>(memory_.data()); }
    const sqlite3_io_methods* methods() { return file()->pMethods; }
    void close() {
        if (file()->pMethods != nullptr)
            file()->pMethods->xClose(file());
        file()->pMethods = nullptr;
    }

    static constexpr int kFlags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE |
                                  SQLITE_OPEN_EXCLUSIVE | SQLITE_OPEN_DELETEONCLOSE |
                                  SQLITE_OPEN_MAIN_DB;
    int rc = -1;
    int outFlags = 0;

  private:
    sqlite3_vfs* vfs_ = nullptr;
    std::vector<unsigned char> memory_ = std::vector<unsigned char>(8);
};

}  // namespace

TEST(TemporaryFiles, LayerIsThePrivateSqlitesDefault) {
    ASSERT_TRUE(kov::engine::installTemporaryFiles());
    sqlite3_vfs* layer = sqlite3_vfs_find(kov::engine::kTemporaryFileLayer);
    ASSERT_NE(layer, nullptr);
    EXPECT_EQ(sqlite3_vfs_find(nullptr), layer);
    EXPECT_TRUE(kov::engine::installTemporaryFiles());  // once: nothing changes
    EXPECT_EQ(sqlite3_vfs_find(nullptr), layer);
}

// With no directory chosen there is no file: nothing falls back to another directory.
TEST(TemporaryFiles, NoDirectoryChosenRefusesTheFile) {
    char* previous = temporaryDirectorySetting();
    temporaryDirectorySetting() = nullptr;
    LayerFile f;
    temporaryDirectorySetting() = previous;
    EXPECT_EQ(f.rc, SQLITE_CANTOPEN);
    EXPECT_EQ(f.methods(), nullptr);
    EXPECT_EQ(kov::engine::lastTemporaryFileError(),
              "cannot make a file: no temporary directory was chosen");
}

// A file made in the chosen directory: what is written reads back, a read past the end is
// zero-filled and says so, room is reserved on request, and closing it leaves the directory
// empty.
TEST(TemporaryFiles, FileIsMadeInTheChosenDirectoryAndReservesRoom) {
    kov::test::ScratchDirectory scratch("kov-layer-");
    ASSERT_FALSE(scratch.path().empty());
    TempDirSetting setting(scratch.path());
    {
        LayerFile f;
        ASSERT_EQ(f.rc, SQLITE_OK);
        ASSERT_NE(f.methods(), nullptr);
        EXPECT_EQ(f.outFlags, LayerFile::kFlags);
        const std::string page(4096, 'p');
        ASSERT_EQ(f.methods()->xWrite(f.file(), page.data(), 4096, 8192), SQLITE_OK);
        std::string back(4096, '\0');
        ASSERT_EQ(f.methods()->xRead(f.file(), back.data(), 4096, 8192), SQLITE_OK);
        EXPECT_EQ(back, page);
        std::string past(4096, 'x');
        EXPECT_EQ(f.methods()->xRead(f.file(), past.data(), 4096, 4 << 20),
                  SQLITE_IOERR_SHORT_READ);
        EXPECT_EQ(past, std::string(4096, '\0'));
        sqlite3_int64 want = 1 << 20;
        EXPECT_EQ(f.methods()->xFileControl(f.file(), KOVSQ_FCNTL_RESERVE, &want), SQLITE_OK);
        sqlite3_int64 size = 0;
        EXPECT_EQ(f.methods()->xFileSize(f.file(), &size), SQLITE_OK);
        EXPECT_GE(size, 12288);
        // What is written inside the room reads back.
        ASSERT_EQ(f.methods()->xWrite(f.file(), page.data(), 4096, 500000), SQLITE_OK);
        ASSERT_EQ(f.methods()->xRead(f.file(), back.data(), 4096, 500000), SQLITE_OK);
        EXPECT_EQ(back, page);
        // The store's own size hints are not needed; other controls are not known here.
        EXPECT_EQ(f.methods()->xFileControl(f.file(), SQLITE_FCNTL_SIZE_HINT, &want), SQLITE_OK);
        EXPECT_EQ(f.methods()->xFileControl(f.file(), SQLITE_FCNTL_LOCKSTATE, &size),
                  SQLITE_NOTFOUND);
        f.close();
    }
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
}

// A directory removed since it was chosen: the file is refused, and the message names the
// directory.
TEST(TemporaryFiles, MissingDirectoryRefusesTheFileAndSaysWhere) {
    const std::string gone = kov::test::vanishedDirectory("kov-layer-gone-");
    ASSERT_FALSE(gone.empty());
    TempDirSetting setting(gone);
    LayerFile f;
    EXPECT_EQ(f.rc, SQLITE_CANTOPEN);
    EXPECT_EQ(f.methods(), nullptr);
    const std::string& error = kov::engine::lastTemporaryFileError();
    EXPECT_EQ(error.rfind("cannot make a file in " + gone + ": ", 0), 0u) << error;
    kov::engine::clearTemporaryFileError();
    EXPECT_EQ(kov::engine::lastTemporaryFileError(), "");
}
