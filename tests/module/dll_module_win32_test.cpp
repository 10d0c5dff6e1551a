// The DLL's load and unload on Windows: the entry point accepts the load and turns off thread
// notifications, the DLL goes away again with FreeLibrary, and a host that reaches it only
// through LoadLibrary (dll_host_win32, run as a child process with a fresh KOV_TEMP) can fill
// the store past its cache and unload it without leaving a file behind, or load it without ever
// using the store and find nothing created.
//
// The paths of the DLL, the host and its plugin are given relative to this program's own
// directory (KOV_LIBRARY_FROM_TESTS, KOV_DLL_HOST, KOV_DLL_PLUGIN).
#include "support/Win32Api.h"

#include <winternl.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstddef>
#include <string>
#include <thread>
#include <vector>

#include "host_util.h"
#include "scratch_directory.h"

namespace {

// The directory of this program, with a trailing backslash.
std::string programDirectory() {
    char buffer[MAX_PATH * 4] = {};
    const DWORD n = GetModuleFileNameA(nullptr, buffer, sizeof buffer);
    std::string path(buffer, n);
    const std::size_t at = path.find_last_of("\\/");
    return at == std::string::npos ? std::string() : path.substr(0, at + 1);
}

// `relative` (forward or back slashes) resolved against this program's directory.
std::string besideThisProgram(const std::string& relative) {
    std::string path = programDirectory() + relative;
    for (char& c : path) {
        if (c == '/')
            c = '\\';
    }
    char full[MAX_PATH * 4] = {};
    const DWORD n = GetFullPathNameA(path.c_str(), sizeof full, full, nullptr);
    return n > 0 && n < sizeof full ? std::string(full, n) : path;
}

std::string libraryPath() {
    return besideThisProgram(KOV_LIBRARY_FROM_TESTS);
}

std::string baseName(const std::string& path) {
    const std::size_t at = path.find_last_of("\\/");
    return at == std::string::npos ? path : path.substr(at + 1);
}

std::string directoryOf(const std::string& path) {
    const std::size_t at = path.find_last_of("\\/");
    return at == std::string::npos ? std::string(".") : path.substr(0, at);
}

// The loader's record of one loaded module, as far as it is read here. The layout of these
// leading fields has been the same in every 64-bit Windows (and in Wine); mingw-w64's
// <winternl.h> shows them only as reserved fields.
struct LoaderEntry {
    LIST_ENTRY inLoadOrder;
    LIST_ENTRY inMemoryOrder;
    LIST_ENTRY inInitializationOrder;
    void* dllBase;
    void* entryPoint;
    ULONG sizeOfImage;
    UNICODE_STRING fullDllName;
    UNICODE_STRING baseDllName;
    ULONG flags;
};
static_assert(offsetof(LoaderEntry, flags) == 0x68, "64-bit loader entry layout");

// The loader's flag for a module whose entry point gets no thread-attach or thread-detach
// calls: what DisableThreadLibraryCalls sets.
constexpr ULONG kNoThreadCalls = 0x00040000;

// The loader flags of `module`, or false when the module is not in the loader's list.
bool loaderFlags(HMODULE module, ULONG& flags) {
    PROCESS_BASIC_INFORMATION basic = {};
    if (NtQueryInformationProcess(GetCurrentProcess(), ProcessBasicInformation, &basic,
                                  sizeof basic, nullptr) != 0 ||
        basic.PebBaseAddress == nullptr)
        return false;
    LIST_ENTRY* head = &basic.PebBaseAddress->Ldr->InMemoryOrderModuleList;
    for (LIST_ENTRY* link = head->Flink; link != head; link = link->Flink) {
        const auto* entry = reinterpret_cast<const LoaderEntry*>(
            reinterpret_cast<const char*>(link) - offsetof(LoaderEntry, inMemoryOrder));
        if (entry->dllBase == static_cast<void*>(module)) {
            flags = entry->flags;
            return true;
        }
    }
    return false;
}

TEST(DllModuleWin32, LoadsAndUnloadsWithFreeLibrary) {
    const std::string library = libraryPath();
    const std::string name = baseName(library);
    ASSERT_EQ(GetModuleHandleA(name.c_str()), nullptr) << name << " is loaded already";
    // The load fails when the entry point reports failure on process attach.
    HMODULE module = LoadLibraryA(library.c_str());
    ASSERT_NE(module, nullptr) << library << ": error " << GetLastError();
    EXPECT_EQ(GetModuleHandleA(name.c_str()), module);

    // A thread started and joined while the DLL is loaded runs as any other.
    std::atomic<int> ran{0};
    std::thread worker([&ran] { ran = 1; });
    worker.join();
    EXPECT_EQ(ran.load(), 1);

    EXPECT_NE(FreeLibrary(module), 0);
    EXPECT_EQ(GetModuleHandleA(name.c_str()), nullptr);
}

// Whether the image of `module` carries a thread-local-storage directory.
bool hasTlsDirectory(HMODULE module) {
    const auto* base = reinterpret_cast<const unsigned char*>(module);
    const auto* dos = reinterpret_cast<const IMAGE_DOS_HEADER*>(base);
    const auto* nt = reinterpret_cast<const IMAGE_NT_HEADERS64*>(base + dos->e_lfanew);
    return nt->OptionalHeader.DataDirectory[IMAGE_DIRECTORY_ENTRY_TLS].Size != 0;
}

// The entry point asks for no thread notifications. The loader grants that only to a module
// without static thread-local storage: for one with a TLS directory (and mingw-w64's runtime
// gives every DLL one, for its own TLS callbacks) DisableThreadLibraryCalls fails, the entry
// point goes on, and thread notifications keep arriving, to be ignored by the entry point.
TEST(DllModuleWin32, EntryPointAsksForNoThreadNotifications) {
    const std::string library = libraryPath();
    HMODULE module = LoadLibraryA(library.c_str());
    ASSERT_NE(module, nullptr) << library << ": error " << GetLastError();
    ULONG flags = 0;
    EXPECT_TRUE(loaderFlags(module, flags)) << "not in the loader's list";
    if (hasTlsDirectory(module)) {
        EXPECT_EQ(flags & kNoThreadCalls, 0u) << "loader flags " << std::hex << flags;
        // What the entry point's call met: the loader's refusal.
        EXPECT_EQ(DisableThreadLibraryCalls(module), FALSE);
        // Threads started and ended meanwhile pass the entry point without harm.
        std::atomic<int> ran{0};
        std::vector<std::thread> workers;
        for (int i = 0; i < 4; ++i)
            workers.emplace_back([&ran] { ++ran; });
        for (std::thread& worker : workers)
            worker.join();
        EXPECT_EQ(ran.load(), 4);
    } else {
        EXPECT_NE(flags & kNoThreadCalls, 0u) << "loader flags " << std::hex << flags;
    }
    EXPECT_NE(FreeLibrary(module), 0);
}

TEST(DllModuleWin32, LoadingTwiceCountsReferences) {
    const std::string library = libraryPath();
    const std::string name = baseName(library);
    HMODULE first = LoadLibraryA(library.c_str());
    ASSERT_NE(first, nullptr);
    HMODULE second = LoadLibraryA(library.c_str());
    EXPECT_EQ(second, first);
    EXPECT_NE(FreeLibrary(second), 0);
    EXPECT_EQ(GetModuleHandleA(name.c_str()), first);
    EXPECT_NE(FreeLibrary(first), 0);
    EXPECT_EQ(GetModuleHandleA(name.c_str()), nullptr);
}

// ---- the host program, one process per case ----

std::string quoted(const std::string& argument) {
    return "\"" + argument + "\"";
}

// Runs the host with `arguments` and KOV_TEMP set to `kovTemp`; its exit code, or -1 when it
// could not be started.
int runHost(const std::vector<std::string>& arguments, const std::string& kovTemp) {
    std::string commandLine = quoted(besideThisProgram(KOV_DLL_HOST));
    for (const std::string& argument : arguments)
        commandLine += " " + quoted(argument);

    // The child inherits this process's environment, KOV_TEMP included.
    char previous[32768] = {};
    const DWORD hadPrevious = GetEnvironmentVariableA("KOV_TEMP", previous, sizeof previous);
    SetEnvironmentVariableA("KOV_TEMP", kovTemp.c_str());

    STARTUPINFOA startup = {};
    startup.cb = sizeof startup;
    PROCESS_INFORMATION process = {};
    std::vector<char> line(commandLine.begin(), commandLine.end());
    line.push_back('\0');
    const BOOL started = CreateProcessA(nullptr, line.data(), nullptr, nullptr, FALSE, 0, nullptr,
                                        nullptr, &startup, &process);
    SetEnvironmentVariableA("KOV_TEMP", hadPrevious > 0 ? previous : nullptr);
    if (!started)
        return -1;
    WaitForSingleObject(process.hProcess, INFINITE);
    DWORD code = 0;
    GetExitCodeProcess(process.hProcess, &code);
    CloseHandle(process.hThread);
    CloseHandle(process.hProcess);
    return static_cast<int>(code);
}

TEST(DllHostWin32, LoadWithoutUsingTheStoreCreatesNothing) {
    const kov::test::ScratchDirectory scratch("kov-dll-host-");
    ASSERT_FALSE(scratch.path().empty());
    EXPECT_EQ(runHost({"load-only", libraryPath()}, scratch.path()), 0);
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
}

TEST(DllHostWin32, PagerByItsMangledNameThenUnloadLeavesNothing) {
    const kov::test::ScratchDirectory scratch("kov-dll-host-");
    ASSERT_FALSE(scratch.path().empty());
    EXPECT_EQ(runHost({"instance-by-name", libraryPath()}, scratch.path()), 0);
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
}

TEST(DllHostWin32, StorePastItsCacheThenUnloadLeavesNothing) {
    const kov::test::ScratchDirectory scratch("kov-dll-host-");
    ASSERT_FALSE(scratch.path().empty());
    const std::string library = libraryPath();
    EXPECT_EQ(runHost({"use-and-unload", besideThisProgram(KOV_DLL_PLUGIN), directoryOf(library),
                       baseName(library)},
                      scratch.path()),
              0);
    EXPECT_TRUE(kov::test::entriesOf(scratch.path()).empty());
}

}  // namespace
