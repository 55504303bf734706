#pragma once
// The body of one server run, on the thread that called KxReplRun: starts
// the interrupt and watchdog threads, creates and connects the server
// object, pumps messages until the server quits, then tears down.
// Returns 0 (the run ended), 3 (server object not created or not
// initialized) or 4 (a worker thread did not start). The client process
// handle always becomes RunServer's to close (through the watchdog).
#include <windows.h>
#include <oaidl.h>

#include "host/KxRepl.h"

int RunServer(IDispatch* pClient, HANDLE hClientProcess, HMODULE hPythonDLL, HMODULE hPythonComDLL,
              HANDLE hInterruptPipe, ExecProc pExecProc, ExecComProc pExecComProc);
