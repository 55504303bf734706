#pragma once
// The client watchdog: polls the client process every five seconds; when
// the client has ended (crashed, killed) or can no longer be queried, it
// interrupts all Python code and asks the main thread to quit the run.
#include <windows.h>

// The thread message that asks the main loop to quit the current server
// object; both parameters are 0.
constexpr UINT WM_REPL_QUIT = WM_APP + 1;

// The poll period; the first check comes one period after the start.
constexpr DWORD kWatchdogPeriodMs = 5000;

// Thread procedure for _beginthreadex; pArgs is a ThreadStartArgs with the
// client process handle, which the thread closes on every road out. Ends
// with exit code 0 once it has acted, 2 when the run stops it first.
unsigned __stdcall WatchdogThreadProc(void* pArgs);
