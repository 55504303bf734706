#pragma once
// The functions ReplServer.dll exports to the Python side. All use the C
// calling convention and are exported under these undecorated names. This
// header is plain C; it is the contract for the authors of the Python host.
//
// Rules for callers:
//
// * The interpreter lock must be released during every call (ctypes' CDLL
//   does that; PyDLL does not). KxReplPrint may wait while the main thread
//   sends queued output to the client, and a command the client runs
//   meanwhile needs the lock: a caller that holds it can deadlock the run.
// * The main thread is the thread that called KxReplRun. KxReplGetUserInput
//   and KxReplQuit work only there (elsewhere they log and do nothing).
//   KxReplPrint works on any thread: on the main thread the text goes to the
//   client at once, after everything other threads queued before it; on
//   other threads it is copied into a queue that the main thread sends from
//   its message loop, or the next time it prints. Outside a run (before
//   KxReplRun, after it returned) printed text is dropped.
// * Strings passed in (pszText, pszPrompt) stay the caller's and are read
//   only during the call.
// * A BSTR that comes out (the answer of KxReplGetUserInput) belongs to the
//   caller: read it through KxReplGetString, free it with KxReplFreeString.
// * The result slot a command callback receives (pResult) is filled with
//   KxReplSetResult, which frees what the slot held; the server hands the
//   string on to the client.
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

// Standard output (bIsError 0) or error text (any other value). Null or
// empty text does nothing. Any thread.
void __cdecl KxReplPrint(const wchar_t* pszText, BOOL bIsError);
// Asks the user for a line; pszPrompt may be null. Returns the answer,
// owned by the caller, or NULL (no answer, no client, not the main thread).
// Main thread only.
BSTR __cdecl KxReplGetUserInput(const wchar_t* pszPrompt);
// Ends the run: the running command goes on to its end, later output is
// dropped, and KxReplRun returns once the command has returned. Main thread
// only.
void __cdecl KxReplQuit(void);
// Frees what *pResult holds and stores a copy of pszText (NULL for a null
// text). A null pResult does nothing. Any thread.
void __cdecl KxReplSetResult(BSTR* pResult, const wchar_t* pszText);
// The characters of bstr (the same pointer; NUL-terminated), valid until it
// is freed. Any thread.
wchar_t* __cdecl KxReplGetString(BSTR bstr);
// Frees a BSTR received from the DLL; NULL does nothing. Any thread.
void __cdecl KxReplFreeString(BSTR bstr);

#ifdef __cplusplus
}
#endif
