// The DLL's entry point. On process attach it asks for no thread-attach and
// thread-detach notifications (the library keeps no per-thread state); it
// never fails a load, whatever the reason code.
//
// Windows grants that request only to a DLL without thread-local storage,
// and every mingw-w64 DLL carries a TLS directory for its C runtime, so the
// call returns FALSE there and the notifications keep coming. That is
// harmless: this entry point does nothing with them.
#include "support/Win32Api.h"

extern "C" BOOL WINAPI DllMain(HINSTANCE module, DWORD reason, LPVOID /*reserved*/) {
    if (reason == DLL_PROCESS_ATTACH) DisableThreadLibraryCalls(module);
    return TRUE;
}
