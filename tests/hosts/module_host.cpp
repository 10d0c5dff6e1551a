// A host process for the load and unload tests (module_posix_test runs it, one process per case).
// It never links the store: it reaches the shared library only through dlopen, so what it sees
// at load and unload is what any host sees.
//
//   module_host load-only <path of libkovpager.so>
//       loads and unloads the library without making a table; checks that nothing was created
//       in $KOV_TEMP and that no engine file was ever open.
//   module_host use-and-unload <path of the test plugin> <SONAME of the library>
//       fills the store past its page cache through the plugin, checks the records and that the
//       engine's file lives (already unlinked) in $KOV_TEMP, destroys the table, unloads the
//       plugin and checks that both modules are gone, no engine file is open and $KOV_TEMP is
//       empty.
//   module_host use-and-exit <path of the test plugin>
//       fills the store past its page cache and returns from main with the table still alive.
//   module_host load-forever <path of the test plugin>
//       fills the store past its page cache, then keeps loading records until it is killed.
//
// Each case that fills the store prints "spilled" once the engine's file is open. The process
// ends with 0 when every check held, 1 (with a message on stderr) otherwise.
#include <dirent.h>
#include <dlfcn.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "host_util.h"

namespace {

using kov::test::check;
using kov::test::entriesOf;
using kov::test::scratchDir;

constexpr std::int64_t kRecordSize = 1024;
constexpr std::int64_t kBatch = 1000;
constexpr std::int64_t kPastTheCache = 80000;  // 80 MiB of data: past the 64 MiB page cache

// The targets of this process's open descriptors.
std::vector<std::string> openFiles() {
    std::vector<std::string> targets;
    for (const std::string& fd : entriesOf("/proc/self/fd")) {
        char buffer[4096];
        const std::string link = "/proc/self/fd/" + fd;
        const ssize_t n = readlink(link.c_str(), buffer, sizeof buffer - 1);
        if (n > 0)
            targets.emplace_back(buffer, static_cast<std::size_t>(n));
    }
    return targets;
}

// Open descriptors on a file inside `dir`, or on a file the engine names as its own.
std::vector<std::string> engineFiles(const std::string& dir) {
    std::vector<std::string> found;
    for (const std::string& target : openFiles()) {
        if (target.compare(0, dir.size() + 1, dir + "/") == 0 ||
            target.find("/kovpager_") != std::string::npos)
            found.push_back(target);
    }
    return found;
}

std::string join(const std::vector<std::string>& names) {
    std::string out;
    for (const std::string& n : names)
        out += (out.empty() ? "" : ", ") + n;
    return out;
}

template <typename Fn>
Fn symbol(void* module, const char* name) {
    void* address = dlsym(module, name);
    if (address == nullptr) {
        std::fprintf(stderr, "module_host: no symbol %s: %s\n", name, dlerror());
        std::exit(1);
    }
    return reinterpret_cast<Fn>(address);
}

struct Plugin {
    void* module = nullptr;
    void (*open)() = nullptr;
    void (*insert)(std::int64_t, std::int64_t, std::uint32_t) = nullptr;
    std::int64_t (*verify)() = nullptr;
    void (*close)() = nullptr;

    explicit Plugin(const char* path) {
        module = dlopen(path, RTLD_NOW | RTLD_LOCAL);
        if (module == nullptr) {
            std::fprintf(stderr, "module_host: cannot load %s: %s\n", path, dlerror());
            std::exit(1);
        }
        open = symbol<void (*)()>(module, "kovplug_open");
        insert =
            symbol<void (*)(std::int64_t, std::int64_t, std::uint32_t)>(module, "kovplug_insert");
        verify = symbol<std::int64_t (*)()>(module, "kovplug_verify");
        close = symbol<void (*)()>(module, "kovplug_close");
    }
};

// Fills the store until the engine's file is open and at least `atLeast` records are in; returns
// the number of records inserted. Prints "spilled" when the file is first seen.
std::int64_t fillPastTheCache(Plugin& plugin, std::int64_t atLeast) {
    const std::string dir = scratchDir();
    std::int64_t inserted = 0;
    bool spilled = false;
    while (inserted < atLeast || !spilled) {
        plugin.insert(inserted, kBatch, static_cast<std::uint32_t>(kRecordSize));
        inserted += kBatch;
        if (!spilled && !engineFiles(dir).empty()) {
            spilled = true;
            std::printf("spilled after %lld records\n", static_cast<long long>(inserted));
            std::fflush(stdout);
        }
        if (inserted > 4 * (atLeast > kPastTheCache ? atLeast : kPastTheCache)) {
            std::fprintf(stderr, "module_host: no engine file after %lld records\n",
                         static_cast<long long>(inserted));
            std::exit(1);
        }
    }
    return inserted;
}

// The engine's file is in $KOV_TEMP, and already unlinked: nothing in the directory names it.
void checkSpillFile() {
    const std::string dir = scratchDir();
    const std::vector<std::string> files = engineFiles(dir);
    check(files.size() == 1, "one engine file open while in use, found: " + join(files));
    for (const std::string& f : files) {
        check(f.compare(0, dir.size() + 1, dir + "/") == 0, "engine file in KOV_TEMP: " + f);
        check(f.size() > 10 && f.compare(f.size() - 10, 10, " (deleted)") == 0,
              "engine file already unlinked: " + f);
    }
    check(entriesOf(dir).empty(), "KOV_TEMP empty while in use: " + join(entriesOf(dir)));
}

void checkNothingLeft(const char* when) {
    const std::string dir = scratchDir();
    check(engineFiles(dir).empty(),
          std::string("no engine file open ") + when + ": " + join(engineFiles(dir)));
    check(entriesOf(dir).empty(),
          std::string("KOV_TEMP empty ") + when + ": " + join(entriesOf(dir)));
}

int loadOnly(const char* library) {
    void* module = dlopen(library, RTLD_NOW | RTLD_LOCAL);
    if (module == nullptr) {
        std::fprintf(stderr, "module_host: cannot load %s: %s\n", library, dlerror());
        return 1;
    }
    // The store's entry point is there; it is deliberately not called.
    check(dlsym(module, "_ZN8KovPager8instanceEv") != nullptr, "KovPager::instance exported");
    checkNothingLeft("after load");
    check(dlclose(module) == 0, "dlclose succeeds");
    check(dlopen(library, RTLD_NOW | RTLD_NOLOAD) == nullptr, "library unloaded by dlclose");
    checkNothingLeft("after unload");
    std::printf("unloaded\n");
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

int useAndUnload(const char* pluginPath, const char* soname) {
    {
        Plugin plugin(pluginPath);
        plugin.open();
        const std::int64_t inserted = fillPastTheCache(plugin, kPastTheCache);
        check(plugin.verify() == inserted, "every record reads back as written");
        checkSpillFile();
        plugin.close();
        // Dropping the table does not close the engine: its file stays open until unload.
        check(engineFiles(scratchDir()).size() == 1, "engine file open until unload");
        check(dlclose(plugin.module) == 0, "dlclose succeeds");
    }
    check(dlopen(pluginPath, RTLD_NOW | RTLD_NOLOAD) == nullptr, "plugin unloaded");
    check(dlopen(soname, RTLD_NOW | RTLD_NOLOAD) == nullptr, "library unloaded with the plugin");
    checkNothingLeft("after unload");
    std::printf("unloaded\n");
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

int useAndExit(const char* pluginPath) {
    Plugin plugin(pluginPath);
    plugin.open();
    const std::int64_t inserted = fillPastTheCache(plugin, kPastTheCache);
    check(plugin.verify() == inserted, "every record reads back as written");
    checkSpillFile();
    // The table and its cursor stay alive; exit closes the engine.
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

int loadForever(const char* pluginPath) {
    Plugin plugin(pluginPath);
    plugin.open();
    std::int64_t next = fillPastTheCache(plugin, 0);
    for (;;) {
        plugin.insert(next, kBatch, static_cast<std::uint32_t>(kRecordSize));
        next += kBatch;
        if (next > 20 * kPastTheCache) {
            std::fprintf(stderr, "module_host: never killed\n");
            return 1;
        }
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (scratchDir().empty()) {
        std::fprintf(stderr, "module_host: KOV_TEMP must name the scratch directory\n");
        return 2;
    }
    const std::string mode = argc > 1 ? argv[1] : "";
    if (mode == "load-only" && argc == 3)
        return loadOnly(argv[2]);
    if (mode == "use-and-unload" && argc == 4)
        return useAndUnload(argv[2], argv[3]);
    if (mode == "use-and-exit" && argc == 3)
        return useAndExit(argv[2]);
    if (mode == "load-forever" && argc == 3)
        return loadForever(argv[2]);
    std::fprintf(stderr,
                 "usage: module_host load-only|use-and-unload|use-and-exit|load-forever ...\n");
    return 2;
}
