// The DLL's entry point. On process attach it turns off thread-attach and
// thread-detach notifications (the library keeps no per-thread state); it
// never fails a load, whatever the reason code.
#include <windows.h>

extern "C" BOOL WINAPI DllMain(HINSTANCE module, DWORD reason, LPVOID /*reserved*/) {
    if (reason == DLL_PROCESS_ATTACH) DisableThreadLibraryCalls(module);
    return TRUE;
}
