// The module's start-up and shutdown, each case in a process of its own:
//   - loading and unloading the shared library without using it creates nothing;
//   - unloading it after use past the page cache closes the engine and removes its file, and the
//     library really leaves the process (it is neither NODELETE nor pinned by unique symbols);
//   - a process that exits, or is killed in the middle of a load, leaves its KOV_TEMP empty;
//   - after the exit-time hook the pager is closed and empty, host objects destroyed later do no
//     harm, and a new table reopens the engine;
//   - a first construction that throws registers nothing, and the next call constructs.
//
// The library cases run module_host (tests/hosts/module_host.cpp), which reaches the library only
// through dlopen. The pager cases fork this program, which links the store statically; its calls
// of atexit are counted by a link-time wrapper (module_posix_test.cmake wraps the symbol).
#include <gtest/gtest.h>

#include <dirent.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <new>
#include <string>
#include <vector>

#include "engine/btree.h"
#include "host_util.h"
#include "kov_test_access.h"
#include "pager_test_util.h"
#include "scratch_directory.h"
#include "support/FileSystem.h"

extern "C" char** environ;

// Every atexit call made by this program's own code (the pager's included) passes here.
namespace {
int gAtexitCalls = 0;
}  // namespace

extern "C" int __real_atexit(void (*function)());
extern "C" int __wrap_atexit(void (*function)()) {
    ++gAtexitCalls;
    return __real_atexit(function);
}

namespace {

using namespace kovtest;
using kov::test::entriesOf;
using kov::test::joined;
using kov::test::ScratchDirectory;

// --- scratch directories and processes ---

// A child process with its standard output on a pipe.
struct Child {
    pid_t pid = -1;
    int out = -1;
};

// Starts module_host with `args`, KOV_TEMP naming `scratch`.
Child startHost(const std::vector<std::string>& args, const std::string& scratch) {
    std::vector<std::string> env;
    for (char** e = environ; *e != nullptr; ++e) {
        if (std::strncmp(*e, "KOV_TEMP=", 9) != 0)
            env.emplace_back(*e);
    }
    env.push_back("KOV_TEMP=" + scratch);
    std::vector<std::string> argv{KOV_MODULE_HOST};
    argv.insert(argv.end(), args.begin(), args.end());
    std::vector<char*> argp;
    for (std::string& a : argv)
        argp.push_back(a.data());
    argp.push_back(nullptr);
    std::vector<char*> envp;
    for (std::string& e : env)
        envp.push_back(e.data());
    envp.push_back(nullptr);

    int fds[2];
    if (pipe(fds) != 0)
        return {};
    Child child;
    child.pid = fork();
    if (child.pid == 0) {
        dup2(fds[1], STDOUT_FILENO);
        close(fds[0]);
        close(fds[1]);
        execve(argp[0], argp.data(), envp.data());
        _exit(127);
    }
    close(fds[1]);
    child.out = fds[0];
    return child;
}

// Reads the child's output up to the end of the first line containing `marker` (or to the end).
std::string readUntil(int fd, const std::string& marker) {
    std::string text;
    char c;
    while (read(fd, &c, 1) == 1) {
        text += c;
        if (c == '\n' && text.find(marker) != std::string::npos)
            break;
    }
    return text;
}

std::string readAll(int fd) {
    std::string text;
    char buffer[4096];
    ssize_t n;
    while ((n = read(fd, buffer, sizeof buffer)) > 0 || (n < 0 && errno == EINTR)) {
        if (n > 0)
            text.append(buffer, static_cast<std::size_t>(n));
    }
    return text;
}

int waitFor(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return status;
}

// Runs module_host to its end; returns its output, its wait status in `status`.
std::string runHost(const std::vector<std::string>& args, const std::string& scratch, int& status) {
    Child child = startHost(args, scratch);
    if (child.pid <= 0) {
        status = -1;
        return std::string();
    }
    std::string out = readAll(child.out);
    close(child.out);
    status = waitFor(child.pid);
    return out;
}

// Targets of process `pid`'s open descriptors that lie in `dir`.
std::vector<std::string> openFilesIn(pid_t pid, const std::string& dir) {
    std::vector<std::string> found;
    const std::string fdDir = "/proc/" + std::to_string(pid) + "/fd";
    for (const std::string& fd : entriesOf(fdDir)) {
        char buffer[4096];
        const ssize_t n = readlink((fdDir + "/" + fd).c_str(), buffer, sizeof buffer - 1);
        if (n <= 0)
            continue;
        const std::string target(buffer, static_cast<std::size_t>(n));
        if (target.compare(0, dir.size() + 1, dir + "/") == 0)
            found.push_back(target);
    }
    return found;
}

// --- pager cases, in a forked copy of this program ---

// Where a forked child reports: one line per failed check, "done" when it got to the end.
int gReport = -1;

void report(const std::string& line) {
    const std::string text = line + "\n";
    const ssize_t written = write(gReport, text.data(), text.size());
    static_cast<void>(written);
}

#define CHILD_CHECK(condition)                                                         \
    do {                                                                               \
        if (!(condition))                                                              \
            report(std::string("line ") + std::to_string(__LINE__) + ": " #condition); \
    } while (0)

// Runs `body` in a forked child that then exits normally (its exit-time hooks run); returns what
// it reported, its wait status in `status`.
std::string runInChild(const std::function<void()>& body, int& status) {
    int fds[2];
    if (pipe(fds) != 0) {
        status = -1;
        return std::string();
    }
    std::fflush(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        gReport = fds[1];
        body();
        std::exit(0);
    }
    close(fds[1]);
    std::string text = readAll(fds[0]);
    close(fds[0]);
    status = waitFor(pid);
    return text;
}

// The host's file system, except that reading a path's status fails for want of memory while
// armed: the first resolution of the temporary directory then throws.
class StarvedFileSystem : public kov::fs::FileSystem {
  public:
    bool armed = true;
    int statusCalls = 0;

    kov::path::PathStyle style() const override { return host().style(); }
    bool status(const std::string& path, kov::fs::Status& out) override {
        ++statusCalls;
        if (armed)
            throw std::bad_alloc();
        return host().status(path, out);
    }
    bool shareIsDirectory(const std::string& p) override { return host().shareIsDirectory(p); }
    bool makeDirectory(const std::string& p) override { return host().makeDirectory(p); }
    bool removeFile(const std::string& p) override { return host().removeFile(p); }
    bool removeDirectory(const std::string& p) override { return host().removeDirectory(p); }
    bool isLink(const std::string& p) override { return host().isLink(p); }
    bool removeLink(const std::string& p) override { return host().removeLink(p); }
    bool copyFile(const std::string& from, const std::string& to, bool failIfExists) override {
        return host().copyFile(from, to, failIfExists);
    }
    bool moveFile(const std::string& from, const std::string& to) override {
        return host().moveFile(from, to);
    }
    bool list(const std::string& p, std::vector<kov::fs::Entry>& out) override {
        return host().list(p, out);
    }
    std::int64_t now() override { return host().now(); }
    void openStream(std::fstream& stream, const std::string& p,
                    std::ios_base::openmode mode) override {
        host().openStream(stream, p, mode);
    }

  private:
    static kov::fs::FileSystem& host() { return kov::fs::hostFileSystem(); }
};

// Host objects still alive when the process ends, and the check that runs after the pager's hook.
KovBtree* gHeldTable = nullptr;
KovBtreeCursor* gHeldCursor = nullptr;

void afterThePagersExitHook() {
    CHILD_CHECK(KovTestAccess::engine() == nullptr);
    CHILD_CHECK(KovTestAccess::slots().empty());
    CHILD_CHECK(KovTestAccess::slots().capacity() == 0u);
    CHILD_CHECK(kov::engine::temporaryDirectorySetting() == nullptr);
    CHILD_CHECK(KovTestAccess::tempDir(KovPager::instance()).empty());

    // The host destroys what it still holds: nothing is closed twice, no slot reappears.
    delete gHeldCursor;
    CHILD_CHECK(KovTestAccess::slots().empty());
    delete gHeldTable;
    CHILD_CHECK(KovTestAccess::engine() == nullptr);

    // A table made now reopens the engine and works.
    {
        KovBtree table(KovBtree::BlobTable);
        CHILD_CHECK(KovTestAccess::engine() != nullptr);
        KovBtreeCursor cursor(table, true);
        CHILD_CHECK(KovTestAccess::slots().size() == 1u);
        insertBytes(cursor, "b", "after");
        insertBytes(cursor, "a", "exit");
        const auto rows = walkBytes(cursor);
        CHILD_CHECK(rows.size() == 2u);
        CHILD_CHECK(rows.size() == 2u && rows[0].first == "a" && rows[0].second == "exit");
        CHILD_CHECK(rows.size() == 2u && rows[1].first == "b" && rows[1].second == "after");
    }
    CHILD_CHECK(KovTestAccess::slots().empty());
    KovPager::instance()->reset();  // nothing closes the reopened engine otherwise
    report("done");
}

// --- the cases ---

TEST(ModuleLibrary, IsNeitherNodeleteNorPinnedByUniqueSymbols) {
    const std::string command = std::string("readelf -dW --dyn-syms '") + KOV_LIBRARY + "' 2>&1";
    FILE* pipe = popen(command.c_str(), "r");
    ASSERT_NE(pipe, nullptr);
    std::string out;
    char buffer[4096];
    std::size_t n;
    while ((n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0)
        out.append(buffer, n);
    ASSERT_EQ(pclose(pipe), 0) << out;
    ASSERT_NE(out.find("SONAME"), std::string::npos) << out;  // readelf read the library
    EXPECT_EQ(out.find("NODELETE"), std::string::npos) << out;
    EXPECT_EQ(out.find("UNIQUE"), std::string::npos) << out;
}

// Runs the host with `arguments` and a fresh scratch directory as its KOV_TEMP: it must exit
// with 0 after printing each of `printed`, and leave the directory empty.
static void expectHostLeavesNothing(const std::vector<std::string>& arguments,
                             const std::vector<std::string>& printed) {
    const ScratchDirectory scratch("kov_module_");  // the test's KOV_TEMP
    ASSERT_FALSE(scratch.path().empty());
    int status = 0;
    const std::string out = runHost(arguments, scratch.path(), status);
    ASSERT_TRUE(WIFEXITED(status)) << status;
    EXPECT_EQ(WEXITSTATUS(status), 0) << out;
    for (const std::string& word : printed)
        EXPECT_NE(out.find(word), std::string::npos) << word << " in " << out;
    EXPECT_TRUE(entriesOf(scratch.path()).empty()) << joined(entriesOf(scratch.path()));
}

TEST(ModuleLibrary, LoadAndUnloadWithoutUseCreatesNothing) {
    expectHostLeavesNothing({"load-only", KOV_LIBRARY}, {"unloaded"});
}

TEST(ModuleLibrary, UnloadAfterUsePastTheCacheClosesTheEngineAndLeavesNothing) {
    expectHostLeavesNothing({"use-and-unload", KOV_MODULE_PLUGIN, KOV_LIBRARY_SONAME},
                            {"spilled", "unloaded"});
}

TEST(ModuleExit, ProcessThatExitsAfterUseLeavesItsTemporaryDirectoryEmpty) {
    expectHostLeavesNothing({"use-and-exit", KOV_MODULE_PLUGIN}, {"spilled"});
}

TEST(ModuleExit, ProcessKilledInTheMiddleOfALoadLeavesItsTemporaryDirectoryEmpty) {
    const ScratchDirectory scratch("kov_module_");  // the test's KOV_TEMP
    ASSERT_FALSE(scratch.path().empty());
    Child child = startHost({"load-forever", KOV_MODULE_PLUGIN}, scratch.path());
    ASSERT_GT(child.pid, 0);
    const std::string out = readUntil(child.out, "spilled");
    // While it loads, its engine file is open in the scratch directory and already unlinked.
    const std::vector<std::string> open = openFilesIn(child.pid, scratch.path());
    const std::vector<std::string> listed = entriesOf(scratch.path());
    kill(child.pid, SIGKILL);
    const int status = waitFor(child.pid);
    close(child.out);

    EXPECT_NE(out.find("spilled"), std::string::npos) << out;
    ASSERT_EQ(open.size(), 1u) << joined(open);
    EXPECT_NE(open[0].find(" (deleted)"), std::string::npos) << open[0];
    EXPECT_TRUE(listed.empty()) << joined(listed);
    ASSERT_TRUE(WIFSIGNALED(status)) << status;
    EXPECT_EQ(WTERMSIG(status), SIGKILL);
    EXPECT_TRUE(entriesOf(scratch.path()).empty()) << joined(entriesOf(scratch.path()));
}

TEST(ModuleExit, ExitHookLeavesAClosedEmptyPagerThatLaterHostObjectsCanUse) {
    const ScratchDirectory scratch("kov_module_");  // the test's KOV_TEMP
    ASSERT_FALSE(scratch.path().empty());
    int status = 0;
    const std::string reported = runInChild(
        [&] {
            setenv("KOV_TEMP", scratch.path().c_str(), 1);
            // Registered before the pager exists, so it runs after the pager's own hook.
            std::atexit(&afterThePagersExitHook);
            gHeldTable = new KovBtree(KovBtree::IntKeyTable);
            gHeldCursor = new KovBtreeCursor(*gHeldTable, true);
            gHeldCursor->insert(1, "held", 4);
            CHILD_CHECK(KovTestAccess::engine() != nullptr);
            CHILD_CHECK(KovTestAccess::slots().size() == 1u);
            CHILD_CHECK(KovTestAccess::tempDir(KovPager::instance()) == scratch.path());
        },
        status);
    EXPECT_EQ(reported, "done\n");
    ASSERT_TRUE(WIFEXITED(status)) << status;
    EXPECT_EQ(WEXITSTATUS(status), 0);
    EXPECT_TRUE(entriesOf(scratch.path()).empty()) << joined(entriesOf(scratch.path()));
}

TEST(ModuleStartup, FailedFirstConstructionRegistersNothingAndTheNextCallConstructs) {
    const ScratchDirectory scratch("kov_module_");  // the test's KOV_TEMP
    ASSERT_FALSE(scratch.path().empty());
    int status = 0;
    const std::string reported = runInChild(
        [&] {
            setenv("KOV_TEMP", scratch.path().c_str(), 1);
            const int before = gAtexitCalls;
            StarvedFileSystem starved;
            kov::fs::FileSystem* const previous = kov::fs::TEST_setFileSystem(&starved);
            bool threw = false;
            try {
                KovPager::instance();
            } catch (const std::bad_alloc&) {
                threw = true;
            }
            CHILD_CHECK(threw);
            CHILD_CHECK(starved.statusCalls > 0);
            CHILD_CHECK(gAtexitCalls == before);
            CHILD_CHECK(kov::engine::temporaryDirectorySetting() == nullptr);

            starved.armed = false;
            KovPager* const pager = KovPager::instance();
            CHILD_CHECK(pager != nullptr);
            CHILD_CHECK(gAtexitCalls == before + 1);
            CHILD_CHECK(KovTestAccess::engine() != nullptr);
            CHILD_CHECK(KovTestAccess::tempDir(pager) == scratch.path());
            CHILD_CHECK(kov::engine::temporaryDirectorySetting() ==
                        KovTestAccess::tempDir(pager).c_str());
            CHILD_CHECK(KovPager::instance() == pager);
            CHILD_CHECK(gAtexitCalls == before + 1);
            kov::fs::TEST_setFileSystem(previous);
            {
                KovBtree table(KovBtree::IntKeyTable);
                KovBtreeCursor cursor(table, true);
                insertInt(cursor, 7, "seven");
                const auto rows = walkInts(cursor);
                CHILD_CHECK(rows.size() == 1u && rows[0].first == 7 && rows[0].second == "seven");
            }
            report("done");
        },
        status);
    EXPECT_EQ(reported, "done\n");
    ASSERT_TRUE(WIFEXITED(status)) << status;
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

}  // namespace
