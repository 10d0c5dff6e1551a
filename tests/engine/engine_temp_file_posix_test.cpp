// The temporary-file layer's POSIX calls (engine/temp_file_os.h): a name that is taken, by a file
// or by a symbolic link, is refused and left alone; the file is the process's user's alone
// whatever the umask; and it is gone from the directory as soon as it is made.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>
#include <string>

#include "engine/private_sqlite3.h"
#include "engine/temp_file_os.h"
#include "host_util.h"
#include "scratch_directory.h"

namespace tf = kov::engine::tempfile;

TEST(TemporaryFilesPosix, TakenNameIsRefusedAndLeftAlone) {
    kov::test::ScratchDirectory scratch("kov-layer-posix-");
    ASSERT_FALSE(scratch.path().empty());
    const std::string dir = scratch.path();
    { std::ofstream(dir + "/taken") << "kept"; }
    ASSERT_EQ(::symlink((dir + "/elsewhere").c_str(), (dir + "/link").c_str()), 0);
    for (const char* name : {"taken", "link"}) {
        SCOPED_TRACE(name);
        tf::Handle h = tf::kNoHandle;
        bool exists = false;
        std::string error;
        EXPECT_EQ(tf::create(dir, name, &h, &exists, &error), SQLITE_CANTOPEN);
        EXPECT_TRUE(exists);
        EXPECT_EQ(h, tf::kNoHandle);
        EXPECT_EQ(error, "cannot make a file in " + dir + ": File exists");
    }
    // Neither the file nor the link's target was touched.
    std::string text;
    std::ifstream(dir + "/taken") >> text;
    EXPECT_EQ(text, "kept");
    struct stat st {};
    EXPECT_NE(::stat((dir + "/elsewhere").c_str(), &st), 0);
}

TEST(TemporaryFilesPosix, FileIsTheUsersAloneAndUnlinkedAtOnce) {
    kov::test::ScratchDirectory scratch("kov-layer-posix-");
    ASSERT_FALSE(scratch.path().empty());
    const mode_t previous = ::umask(0);
    tf::Handle h = tf::kNoHandle;
    bool exists = true;
    std::string error;
    const int rc = tf::create(scratch.path(), "kovpager_test", &h, &exists, &error);
    ::umask(previous);
    ASSERT_EQ(rc, SQLITE_OK) << error;
    EXPECT_FALSE(exists);
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
    struct stat st {};
    ASSERT_EQ(::fstat(static_cast<int>(h), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, static_cast<mode_t>(0600));
    EXPECT_EQ(st.st_nlink, 0u);
    EXPECT_NE(::fcntl(static_cast<int>(h), F_GETFD) & FD_CLOEXEC, 0);
    // Room reserved is held: the file's size covers it.
    EXPECT_EQ(tf::reserve(h, 0, 1 << 20, &error), SQLITE_OK) << error;
    std::int64_t size = 0;
    EXPECT_EQ(tf::size(h, &size, &error), SQLITE_OK);
    EXPECT_EQ(size, 1 << 20);
    tf::close(h);
}
