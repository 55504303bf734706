// The DLL's entry point. The C runtime has constructed the module object and
// its records before this runs; a module whose locks could not be made must
// not be loaded at all.
#include <windows.h>

#include "server/Module.h"

extern "C" BOOL WINAPI DllMain(HINSTANCE, DWORD dwReason, LPVOID)
{
    if (dwReason == DLL_PROCESS_ATTACH && ATL::g_bAtlInitFailed) return FALSE;
    return TRUE;
}
