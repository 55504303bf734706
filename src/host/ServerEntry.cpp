// Placeholder body: the server entry replaces this file.
#include "host/KxRepl.h"

extern "C" int __cdecl KxReplRun(const char*, DWORD, HMODULE, HMODULE, HANDLE, ExecProc, ExecComProc)
{
    return 1;
}
