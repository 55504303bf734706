#pragma once
// Waiting while pumping: a thread that serves COM calls (a single-threaded
// apartment) receives them as window messages, so every wait on such a
// thread must keep dispatching them. This matters at the end of a session
// too: after Quit the server's last Release calls back into the client, so
// the client keeps pumping until the host process has exited.
//
// A WM_QUIT met on the way is not lost: it is posted again when the wait
// ends.
#include <windows.h>

#include <functional>

// Dispatches every message already queued for this thread.
void PumpPending();

// Waits until one of the handles is signaled or the timeout passes,
// dispatching messages meanwhile. Returns WAIT_OBJECT_0 + index of the
// signaled handle, WAIT_TIMEOUT, or WAIT_FAILED (more than 63 handles, a bad
// handle). With no handles it only pumps for the given time and returns
// WAIT_TIMEOUT. INFINITE waits forever.
DWORD PumpWaitAny(const HANDLE* phHandles, DWORD nHandles, DWORD dwTimeoutMs);
// True when h was signaled within the timeout.
bool PumpWait(HANDLE h, DWORD dwTimeoutMs);
// Pumps for the given time.
void PumpFor(DWORD dwMs);
// Pumps until fnDone() is true (checked at least every dwPollMs) or the
// timeout passes; returns fnDone()'s last value.
bool PumpUntil(const std::function<bool()>& fnDone, DWORD dwTimeoutMs, DWORD dwPollMs = 10);
