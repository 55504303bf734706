#pragma once
// The interrupt channel: the client writes single command bytes into a pipe
// whose read end the host handed to KxReplRun, and the interrupt thread
// turns them into keyboard interrupts in Python.
//   'a'  interrupt the command that the main thread runs
//   'k'  that, and KeyboardInterrupt in every other Python thread
#include <windows.h>

// Thread procedure for _beginthreadex; pArgs is a ThreadStartArgs with the
// pipe's read end, which the thread never closes. Ends with exit code 1
// when a read fails (the write end was closed) or returns a full buffer,
// and with 2 when the run stops it.
unsigned __stdcall InterruptThreadProc(void* pArgs);

// Raises a keyboard interrupt in the main thread's running command and,
// with bAllThreads, in every other thread of the process that runs Python
// code. Looks its entry points up by name in hPythonDLL on every call.
// Called by the interrupt thread and the watchdog; any thread but the main
// thread. Failures are logged and absorbed.
void InterruptPython(HMODULE hPythonDLL, bool bAllThreads) noexcept;
