#include "python/Watchdog.h"

#include "host/RunState.h"
#include "python/Interrupt.h"
#include "python/WorkerThreads.h"

namespace {

// Waits out each period and checks the client. True when the client is
// gone (or cannot be queried), false when the run asked the thread to stop.
bool WaitForClientEnd(HANDLE hClientProcess, const CWorkerStop& stop) noexcept
{
    for (;;) {
        if (stop.Wait(kWatchdogPeriodMs)) {
            return false;
        }
        DWORD dwExitCode = 0;
        if (!::GetExitCodeProcess(hClientProcess, &dwExitCode)) {
            LogErrorNoThrow("Cannot get exit code of client process");
            return true;
        }
        // A client that ended with the code 259 is taken for a running one.
        if (dwExitCode != STILL_ACTIVE) {
            return true;
        }
    }
}

}  // namespace

unsigned __stdcall WatchdogThreadProc(void* pArgs)
{
    ThreadStartArgs args = TakeStartArgs(pArgs);
    CWorkerStop& stop = *args.pStop;
    // A run that ends while the check runs must not be quit afterwards.
    if (!WaitForClientEnd(args.hHandle, stop) || stop.IsRequested()) {
        stop.CloseClientProcess();
        return kThreadStopped;
    }
    // In this order: a busy main thread meets the interrupt first and takes
    // the quit request from its queue only back in its message loop.
    LogErrorNoThrow("Client process unavailable, stopping all threads");
    InterruptPython(args.hPythonDLL, true);
    stop.CloseClientProcess();
    // A quit request that outlived its run would end the next run on the
    // same thread.
    if (stop.IsRequested()) {
        return kThreadStopped;
    }
    ::PostThreadMessageW(g_dwMainThreadId.load(), WM_REPL_QUIT, 0, 0);
    return kThreadActed;
}
