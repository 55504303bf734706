#include "python/WorkerThreads.h"

#include <process.h>

#include <new>

#include "host/RunState.h"
#include "python/Interrupt.h"
#include "python/Watchdog.h"

namespace {

// How long a stop waits for a thread to answer before ending it by force.
constexpr DWORD kStopWaitMs = 2000;
// The pause between two cancels of the interrupt thread's read.
constexpr DWORD kCancelRetryMs = 10;

// The last resort for a thread that does not answer the stop request.
// True when the thread has ended.
bool EndByForce(HANDLE hThread, const char* pszMessage) noexcept
{
    LogErrorNoThrow(pszMessage);
    ::TerminateThread(hThread, kThreadStopped);
    return ::WaitForSingleObject(hThread, kStopWaitMs) == WAIT_OBJECT_0;
}

}  // namespace

bool CWorkerStop::Create() noexcept
{
    m_hEvent.Reset(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    return m_hEvent.IsValid();
}

void CWorkerStop::Request() noexcept
{
    m_bRequested = true;
    ::SetEvent(m_hEvent.Get());
}

bool CWorkerStop::Wait(DWORD dwMs) const noexcept
{
    if (m_bRequested) {
        return true;
    }
    return ::WaitForSingleObject(m_hEvent.Get(), dwMs) == WAIT_OBJECT_0 || m_bRequested;
}

void CWorkerStop::CloseClientProcess() noexcept
{
    HANDLE hProcess = m_hClientProcess.exchange(nullptr);
    if (hProcess != nullptr) {
        ::CloseHandle(hProcess);
    }
}

ThreadStartArgs TakeStartArgs(void* pArgs) noexcept
{
    ThreadStartArgs* pRecord = static_cast<ThreadStartArgs*>(pArgs);
    ThreadStartArgs args = *pRecord;
    delete pRecord;
    return args;
}

bool CWorkerThreads::Start(HMODULE hPythonDLL, HANDLE hInterruptPipe, HANDLE hClientProcess) noexcept
{
    Stop();
    CHandle hProcess(hClientProcess);  // ours until the stop request owns it
    m_pStop.reset(new (std::nothrow) CWorkerStop);
    if (!m_pStop || !m_pStop->Create() ||
        !StartThread(InterruptThreadProc, hPythonDLL, hInterruptPipe, m_hInterruptThread)) {
        LogErrorNoThrow("Cannot start interrupt thread");
        m_pStop.reset();
        return false;
    }
    m_pStop->AdoptClientProcess(hProcess.Detach());
    if (!StartThread(WatchdogThreadProc, hPythonDLL, hClientProcess, m_hWatchdogThread)) {
        LogErrorNoThrow("Cannot start watchdog thread");
        Stop();
        return false;
    }
    return true;
}

bool CWorkerThreads::StartThread(unsigned(__stdcall* pfnProc)(void*), HMODULE hPythonDLL, HANDLE hHandle,
                                 CHandle& hThread) noexcept
{
    ThreadStartArgs* pArgs = new (std::nothrow) ThreadStartArgs{hPythonDLL, hHandle, m_pStop.get()};
    if (pArgs == nullptr) {
        return false;
    }
    uintptr_t nThread = ::_beginthreadex(nullptr, 0, pfnProc, pArgs, 0, nullptr);
    if (nThread == 0) {
        delete pArgs;  // no thread took it over
        return false;
    }
    hThread.Reset(reinterpret_cast<HANDLE>(nThread));
    return true;
}

void CWorkerThreads::Stop() noexcept
{
    if (!m_pStop) {
        return;
    }
    m_pStop->Request();
    bool bEnded = StopInterruptThread();
    bEnded = StopWatchdogThread() && bEnded;
    m_pStop->CloseClientProcess();
    if (bEnded) {
        m_pStop.reset();
    } else {
        // A thread that survived even the forced end may still read the
        // stop request: leave it allocated rather than pull it away.
        static_cast<void>(m_pStop.release());
    }
}

bool CWorkerThreads::StopInterruptThread() noexcept
{
    if (!m_hInterruptThread) {
        return true;
    }
    HANDLE hThread = m_hInterruptThread.Get();
    // The thread tests the request before each read, so a cancel that lands
    // just before it enters ReadFile is followed by one that finds it there.
    bool bEnded = false;
    ULONGLONG ullDeadline = ::GetTickCount64() + kStopWaitMs;
    while (!bEnded && ::GetTickCount64() < ullDeadline) {
        ::CancelSynchronousIo(hThread);
        bEnded = ::WaitForSingleObject(hThread, kCancelRetryMs) == WAIT_OBJECT_0;
    }
    if (!bEnded) {
        bEnded = EndByForce(hThread, "Interrupt thread does not stop, ending it by force");
    }
    m_hInterruptThread.Reset();
    return bEnded;
}

bool CWorkerThreads::StopWatchdogThread() noexcept
{
    if (!m_hWatchdogThread) {
        return true;
    }
    HANDLE hThread = m_hWatchdogThread.Get();
    bool bEnded = ::WaitForSingleObject(hThread, kStopWaitMs) == WAIT_OBJECT_0 ||
                  EndByForce(hThread, "Watchdog thread does not stop, ending it by force");
    m_hWatchdogThread.Reset();
    return bEnded;
}
