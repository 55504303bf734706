#pragma once
// The two worker threads of a server run, the interrupt thread and the
// watchdog, and their cooperative stop.
//
// The main loop uses one CWorkerThreads per run, on the main thread:
//
//   CWorkerThreads threads;
//   if (!threads.Start(hPythonDLL, hInterruptPipe, hClientProcess))
//       return 4;                      // already logged and cleaned up
//   ... OpenOutputQueue(), the server object, the message loop ...
//   CloseOutputQueue();
//   threads.Stop();                    // the destructor stops them too
//
// Stop never catches a thread while it holds the interpreter lock or any
// other lock: it raises a stop request that each thread answers at its next
// wait (the watchdog's five-second wait, the interrupt thread's pipe read,
// which is cancelled), and waits for both. Each thread then ends with exit
// code 2. Only a thread that does not answer within a bounded time is ended
// by force (TerminateThread, exit code 2) as a last resort.
#include <windows.h>

#include <atomic>
#include <memory>

#include "common/Raii.h"

// The stop request of one run, shared by its worker threads and the thread
// that stops them. It outlives both threads.
class CWorkerStop
{
public:
    // False when the event cannot be made.
    bool Create() noexcept;
    void Request() noexcept;
    bool IsRequested() const noexcept { return m_bRequested.load(); }
    // Waits up to dwMs; true as soon as the stop is requested.
    bool Wait(DWORD dwMs) const noexcept;

    // The watchdog's client process handle, closed exactly once: by the
    // watchdog on each of its own roads out, or by the stopper when the
    // thread had to be ended by force and could not close it.
    void AdoptClientProcess(HANDLE hProcess) noexcept { m_hClientProcess = hProcess; }
    void CloseClientProcess() noexcept;

private:
    CHandle m_hEvent;  // manual reset, set by Request
    std::atomic<bool> m_bRequested{false};
    std::atomic<HANDLE> m_hClientProcess{nullptr};
};

// The start record of a worker thread, on the heap; the thread copies it
// and frees it first thing.
struct ThreadStartArgs
{
    HMODULE hPythonDLL;
    // The interrupt pipe's read end (interrupt thread; stays the caller's)
    // or the client process handle (watchdog; pStop owns it).
    HANDLE hHandle;
    CWorkerStop* pStop;
};

// Takes the record out of a thread's start argument and frees it.
ThreadStartArgs TakeStartArgs(void* pArgs) noexcept;

// Exit codes of the worker threads.
enum : unsigned
{
    kThreadActed = 0,     // the watchdog found the client gone and acted
    kThreadFailed = 1,    // the interrupt pipe failed or broke the protocol
    kThreadStopped = 2,   // stopped at teardown (cooperatively or by force)
};

class CWorkerThreads
{
public:
    CWorkerThreads() noexcept = default;
    CWorkerThreads(const CWorkerThreads&) = delete;
    CWorkerThreads& operator=(const CWorkerThreads&) = delete;
    ~CWorkerThreads() { Stop(); }

    // Starts the interrupt thread on hInterruptPipe (which stays the
    // caller's), then the watchdog on hClientProcess (which becomes the
    // watchdog's, or is closed here when the watchdog never gets it).
    // On failure logs "Cannot start interrupt thread" or "Cannot start
    // watchdog thread", stops what did start and returns false.
    bool Start(HMODULE hPythonDLL, HANDLE hInterruptPipe, HANDLE hClientProcess) noexcept;

    // Asks both threads to stop, waits until they have ended and closes
    // their handles. Safe to call more than once and when nothing started.
    void Stop() noexcept;

    // The thread handles, null when not running; for waiting and exit codes.
    HANDLE InterruptThread() const noexcept { return m_hInterruptThread.Get(); }
    HANDLE WatchdogThread() const noexcept { return m_hWatchdogThread.Get(); }

private:
    bool StartThread(unsigned(__stdcall* pfnProc)(void*), HMODULE hPythonDLL, HANDLE hHandle,
                     CHandle& hThread) noexcept;
    // True when the thread has ended.
    bool StopInterruptThread() noexcept;
    bool StopWatchdogThread() noexcept;

    std::unique_ptr<CWorkerStop> m_pStop;
    CHandle m_hInterruptThread;
    CHandle m_hWatchdogThread;
};
