#pragma once
// The functions ReplServer.dll exports to the Python side. All use the C
// calling convention and are exported under these undecorated names.
#include <windows.h>
#include <oleauto.h>

#ifdef __cplusplus
extern "C" {
#endif

struct _object;

// Command callbacks the Python side hands to KxReplRun; 0 means success.
typedef int(__cdecl* ExecProc)(BSTR Command, BSTR Argument, BSTR* pResult);
typedef int(__cdecl* ExecComProc)(BSTR Command, struct _object* Argument, struct _object** pResult);

int __cdecl KxReplRun(const char* pszClient, DWORD dwClientPID, HMODULE hPythonDLL, HMODULE hPythonComDLL,
                      HANDLE hInterruptPipe, ExecProc pExecProc, ExecComProc pExecComProc);
void __cdecl KxReplPrint(const wchar_t* pszText, BOOL bIsError);
BSTR __cdecl KxReplGetUserInput(const wchar_t* pszPrompt);
void __cdecl KxReplQuit(void);
void __cdecl KxReplSetResult(BSTR* pResult, const wchar_t* pszText);
wchar_t* __cdecl KxReplGetString(BSTR bstr);
void __cdecl KxReplFreeString(BSTR bstr);

#ifdef __cplusplus
}
#endif
