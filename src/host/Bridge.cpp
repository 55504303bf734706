// Placeholder bodies: the output and input bridge replaces this file.
#include "host/KxRepl.h"

extern "C" {
void __cdecl KxReplPrint(const wchar_t*, BOOL) {}
BSTR __cdecl KxReplGetUserInput(const wchar_t*) { return nullptr; }
void __cdecl KxReplQuit(void) {}
void __cdecl KxReplSetResult(BSTR*, const wchar_t*) {}
wchar_t* __cdecl KxReplGetString(BSTR bstr) { return bstr; }
void __cdecl KxReplFreeString(BSTR) {}
}
