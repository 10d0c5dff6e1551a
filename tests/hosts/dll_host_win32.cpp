// A host process for the Windows load and unload tests (dll_module_win32_test runs it, one
// process per case). It never links the store: it reaches the DLL only through LoadLibrary and
// GetProcAddress, so what it sees at load and unload is what any host sees. $KOV_TEMP names a
// fresh, empty directory.
//
//   dll_host_win32 load-only <path of libkovpager.dll>
//       loads the DLL, finds a member of each exported class by its mangled name, unloads it;
//       checks that the DLL is gone and that nothing was created in $KOV_TEMP.
//   dll_host_win32 instance-by-name <path of libkovpager.dll>
//       loads the DLL, calls KovPager::instance() through its mangled name (the store comes into
//       being with an empty engine), unloads it; checks that the DLL is gone and $KOV_TEMP empty.
//   dll_host_win32 use-and-unload <path of the test plugin> <directory of the DLL> <its name>
//       fills the store past its page cache through the plugin (80 000 records of 1 KiB), checks
//       that the engine's file lives in $KOV_TEMP meanwhile and that every record reads back,
//       destroys the table, unloads the plugin and checks that both DLLs are gone and $KOV_TEMP
//       is empty.
//
// The process ends with 0 when every check held, 1 (with a message on stderr) otherwise.
#include "support/Win32Api.h"

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "host_util.h"

namespace {

using kov::test::check;
using kov::test::entriesOf;
using kov::test::joined;
using kov::test::scratchDir;

constexpr std::int64_t kRecordSize = 1024;
constexpr std::int64_t kBatch = 1000;
constexpr std::int64_t kPastTheCache = 80000;  // 80 MiB of data: past the 64 MiB page cache

// Mangled names of one member of each exported class.
constexpr const char* kPagerInstance = "_ZN8KovPager8instanceEv";
constexpr const char* kTableConstructor = "_ZN8KovBtreeC1ENS_9TableTypeE";
constexpr const char* kCursorInsert = "_ZN14KovBtreeCursor6insertExPKvy";

// The final name of a path ("libkovpager.dll" of "..\libkovpager.dll").
std::string baseName(const std::string& path) {
    const std::size_t at = path.find_last_of("\\/:");
    return at == std::string::npos ? path : path.substr(at + 1);
}

bool isLoaded(const std::string& name) {
    return GetModuleHandleA(name.c_str()) != nullptr;
}

template <typename F>
F resolve(HMODULE module, const char* name) {
    FARPROC p = GetProcAddress(module, name);
    check(p != nullptr, std::string("export ") + name + " found");
    return reinterpret_cast<F>(reinterpret_cast<void*>(p));
}

int loadOnly(const std::string& library) {
    const std::string name = baseName(library);
    check(!isLoaded(name), name + " not loaded before LoadLibrary");
    HMODULE module = LoadLibraryA(library.c_str());
    if (module == nullptr) {
        std::fprintf(stderr, "dll_host_win32: LoadLibrary(%s) failed: %lu\n", library.c_str(),
                     GetLastError());
        return 1;
    }
    check(GetModuleHandleA(name.c_str()) == module, "GetModuleHandle finds the loaded DLL");
    for (const char* member : {kPagerInstance, kTableConstructor, kCursorInsert})
        check(GetProcAddress(module, member) != nullptr, std::string("export ") + member);
    for (const char* engine : {"sqlite3_open", "kovpager_sqlite3_open", "kovsq_tree_open"})
        check(GetProcAddress(module, engine) == nullptr, std::string("not exported: ") + engine);
    check(FreeLibrary(module) != 0, "FreeLibrary succeeds");
    check(!isLoaded(name), name + " unloaded");
    const std::vector<std::string> left = entriesOf(scratchDir());
    check(left.empty(), "nothing created in KOV_TEMP: " + joined(left));
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

int instanceByName(const std::string& library) {
    const std::string name = baseName(library);
    HMODULE module = LoadLibraryA(library.c_str());
    if (module == nullptr) {
        std::fprintf(stderr, "dll_host_win32: LoadLibrary(%s) failed: %lu\n", library.c_str(),
                     GetLastError());
        return 1;
    }
    using Instance = void* (*)();
    const auto instance = resolve<Instance>(module, kPagerInstance);
    if (instance != nullptr) {
        void* first = instance();
        check(first != nullptr, "KovPager::instance() gives a pager");
        check(instance() == first, "KovPager::instance() gives the same pager twice");
    }
    check(FreeLibrary(module) != 0, "FreeLibrary succeeds");
    check(!isLoaded(name), name + " unloaded");
    const std::vector<std::string> left = entriesOf(scratchDir());
    check(left.empty(), "nothing left in KOV_TEMP: " + joined(left));
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

int useAndUnload(const std::string& plugin, const std::string& libraryDir,
                 const std::string& libraryName) {
    const std::string dir = scratchDir();
    check(!dir.empty(), "KOV_TEMP is set");
    // The plugin's own import of the store's DLL is searched for there as well.
    check(SetDllDirectoryA(libraryDir.c_str()) != 0, "SetDllDirectory(" + libraryDir + ")");
    HMODULE module = LoadLibraryA(plugin.c_str());
    if (module == nullptr) {
        std::fprintf(stderr, "dll_host_win32: LoadLibrary(%s) failed: %lu\n", plugin.c_str(),
                     GetLastError());
        return 1;
    }
    check(isLoaded(libraryName), libraryName + " loaded with the plugin");
    using Open = void (*)();
    using Insert = void (*)(std::int64_t, std::int64_t, std::uint32_t);
    using Verify = std::int64_t (*)();
    using Close = void (*)();
    const auto open = resolve<Open>(module, "kovplug_open");
    const auto insert = resolve<Insert>(module, "kovplug_insert");
    const auto verify = resolve<Verify>(module, "kovplug_verify");
    const auto close = resolve<Close>(module, "kovplug_close");
    if (open == nullptr || insert == nullptr || verify == nullptr || close == nullptr)
        return 1;

    open();
    for (std::int64_t first = 0; first < kPastTheCache; first += kBatch)
        insert(first, kBatch, static_cast<std::uint32_t>(kRecordSize));
    // Past the cache the engine's file exists. Windows keeps its name in the directory until it
    // is closed (it is opened to be deleted on close).
    const std::vector<std::string> spilled = entriesOf(dir);
    check(!spilled.empty(), "the engine's file is in KOV_TEMP");
    if (!spilled.empty())
        std::printf("spilled\n");
    check(verify() == kPastTheCache, "every record reads back");
    close();

    check(FreeLibrary(module) != 0, "FreeLibrary of the plugin succeeds");
    check(!isLoaded(baseName(plugin)), "the plugin is unloaded");
    check(!isLoaded(libraryName), libraryName + " is unloaded with the plugin");
    const std::vector<std::string> left = entriesOf(dir);
    check(left.empty(), "KOV_TEMP is empty after unload: " + joined(left));
    return kov::test::gHostFailures == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
    const std::string mode = argc > 1 ? argv[1] : "";
    if (mode == "load-only" && argc == 3)
        return loadOnly(argv[2]);
    if (mode == "instance-by-name" && argc == 3)
        return instanceByName(argv[2]);
    if (mode == "use-and-unload" && argc == 5)
        return useAndUnload(argv[2], argv[3], argv[4]);
    std::fprintf(stderr,
                 "usage: dll_host_win32 load-only|instance-by-name <library>\n"
                 "       dll_host_win32 use-and-unload <plugin> <library directory> <library "
                 "name>\n");
    return 2;
}
