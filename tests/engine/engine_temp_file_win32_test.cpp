// The temporary-file layer's Windows calls (engine/temp_file_os.h): a name that is taken is
// refused and left alone; the file is the process's alone while it is open (no other opener,
// whatever it asks for) and is gone once closed.
#include <gtest/gtest.h>

#include <fstream>
#include <string>

#include "engine/private_sqlite3.h"
#include "engine/temp_file_os.h"
#include "host_util.h"
#include "scratch_directory.h"
#include "support/Win32Api.h"

namespace tf = kov::engine::tempfile;

TEST(TemporaryFilesWin32, TakenNameIsRefusedAndLeftAlone) {
    kov::test::ScratchDirectory scratch("kov-layer-win32-");
    ASSERT_FALSE(scratch.path().empty());
    { std::ofstream(scratch.path() + "\\taken") << "kept"; }
    tf::Handle h = tf::kNoHandle;
    bool exists = false;
    std::string error;
    EXPECT_EQ(tf::create(scratch.path(), "taken", &h, &exists, &error), SQLITE_CANTOPEN);
    EXPECT_TRUE(exists);
    EXPECT_EQ(h, tf::kNoHandle);
    EXPECT_EQ(error.rfind("cannot make a file in " + scratch.path() + ": ", 0), 0u) << error;
    std::string text;
    std::ifstream(scratch.path() + "\\taken") >> text;
    EXPECT_EQ(text, "kept");
}

TEST(TemporaryFilesWin32, FileIsTheProcesssAloneAndGoneWhenClosed) {
    kov::test::ScratchDirectory scratch("kov-layer-win32-");
    ASSERT_FALSE(scratch.path().empty());
    tf::Handle h = tf::kNoHandle;
    bool exists = true;
    std::string error;
    ASSERT_EQ(tf::create(scratch.path(), "kovpager_test", &h, &exists, &error), SQLITE_OK)
        << error;
    EXPECT_FALSE(exists);
    const std::string path = scratch.path() + "\\kovpager_test";
    HANDLE other = ::CreateFileA(path.c_str(), GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE |
                                 FILE_SHARE_DELETE, nullptr, OPEN_EXISTING, 0, nullptr);
    EXPECT_EQ(other, INVALID_HANDLE_VALUE);
    if (other != INVALID_HANDLE_VALUE)
        ::CloseHandle(other);
    EXPECT_EQ(tf::reserve(h, 0, 1 << 20, &error), SQLITE_OK) << error;
    const char page[16] = "written";
    EXPECT_EQ(tf::writeAt(h, page, sizeof page, 4096, &error), SQLITE_OK) << error;
    char back[16] = {};
    int got = 0;
    EXPECT_EQ(tf::readAt(h, back, sizeof back, 4096, &got, &error), SQLITE_OK) << error;
    EXPECT_EQ(got, static_cast<int>(sizeof back));
    EXPECT_STREQ(back, "written");
    tf::close(h);
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
}
