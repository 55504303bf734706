// The client watchdog: when it checks, what it does when the client has
// gone (and in which order), and that a stop ends it quietly. The "client"
// is a suspended copy of this program, ended with a chosen exit code.
#include <gtest/gtest.h>

#include <windows.h>
#include <process.h>

#include <string>
#include <vector>

#include "common/Raii.h"
#include "host/RunState.h"
#include "py_double_api.h"
#include "python/Watchdog.h"
#include "python/WorkerThreads.h"
#include "server/ExecState.h"
#include "support/DebugCapture.h"

namespace {

constexpr DWORD kWaitMs = 15000;  // upper bound of every wait in this file

HMODULE Runtime() { return ::GetModuleHandleW(L"PyRuntimeDouble.dll"); }

std::string Unavailable() { return LogLine("Client process unavailable, stopping all threads"); }

HANDLE Duplicate(HANDLE h)
{
    HANDLE hCopy = nullptr;
    ::DuplicateHandle(::GetCurrentProcess(), h, ::GetCurrentProcess(), &hCopy, 0, FALSE, DUPLICATE_SAME_ACCESS);
    return hCopy;
}

// A client process that runs no code: this program, started suspended.
class CChildProcess
{
public:
    CChildProcess()
    {
        wchar_t szPath[MAX_PATH];
        ::GetModuleFileNameW(nullptr, szPath, MAX_PATH);
        STARTUPINFOW si{};
        si.cb = sizeof(si);
        PROCESS_INFORMATION pi{};
        if (::CreateProcessW(szPath, nullptr, nullptr, nullptr, FALSE, CREATE_SUSPENDED, nullptr, nullptr, &si, &pi)) {
            m_hProcess.Reset(pi.hProcess);
            ::CloseHandle(pi.hThread);
            m_dwId = pi.dwProcessId;
        }
    }
    ~CChildProcess() { End(0); }
    bool Started() const { return m_hProcess.IsValid(); }
    // A handle with the given rights, for the watchdog to own.
    HANDLE Open(DWORD dwAccess) const { return ::OpenProcess(dwAccess, FALSE, m_dwId); }
    DWORD Id() const { return m_dwId; }
    void End(UINT nExitCode)
    {
        if (m_hProcess && ::TerminateProcess(m_hProcess.Get(), nExitCode)) {
            ::WaitForSingleObject(m_hProcess.Get(), kWaitMs);
        }
    }

private:
    CHandle m_hProcess;
    DWORD m_dwId = 0;
};

// True when hProcess, a value the watchdog owned, no longer refers to the
// child: closed (or its value since taken by another object).
bool HandleGone(HANDLE hProcess, DWORD dwChildId)
{
    DWORD dwFlags = 0;
    return !::GetHandleInformation(hProcess, &dwFlags) || ::GetProcessId(hProcess) != dwChildId;
}

// A thread that runs "Python code" and notes, when its KeyboardInterrupt
// arrives, whether the watchdog's log line was already out.
class CPythonThread
{
public:
    enum Outcome
    {
        kNothing,
        kGotItBeforeTheLogLine,
        kGotItAfterTheLogLine,
    };

    explicit CPythonThread(const CDebugCapture& capture)
        : m_capture(capture), m_hReady(::CreateEventW(nullptr, TRUE, FALSE, nullptr))
    {
        m_hThread.Reset(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Proc, this, 0, nullptr)));
        ::WaitForSingleObject(m_hReady.Get(), kWaitMs);
    }
    ~CPythonThread()
    {
        if (::WaitForSingleObject(m_hThread.Get(), kWaitMs) != WAIT_OBJECT_0) {
            ::TerminateThread(m_hThread.Get(), 99);  // a failed test must not hang
        }
    }
    Outcome WaitOutcome()
    {
        ::WaitForSingleObject(m_hThread.Get(), kWaitMs);
        return m_outcome;
    }

private:
    static unsigned __stdcall Proc(void* pThis)
    {
        static_cast<CPythonThread*>(pThis)->Run();
        return 0;
    }
    void Run()
    {
        TestPy_RegisterThread();
        ::SetEvent(m_hReady.Get());
        if (TestPy_WaitAsyncExc(kWaitMs) == 1) {
            auto vecLines = m_capture.Lines();
            bool bLogged = !vecLines.empty() && vecLines.back() == Unavailable();
            m_outcome = bLogged ? kGotItAfterTheLogLine : kGotItBeforeTheLogLine;
        }
        TestPy_UnregisterThread();
    }

    const CDebugCapture& m_capture;
    CHandle m_hReady;
    CHandle m_hThread;
    Outcome m_outcome = kNothing;
};

class Watchdog : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_NE(Runtime(), nullptr);
        TestPy_Reset();
        g_dwMainThreadId = ::GetCurrentThreadId();
        MSG msg;
        ::PeekMessageW(&msg, nullptr, 0, 0, PM_NOREMOVE);  // the quit request needs a queue
        HANDLE hRead = nullptr;
        HANDLE hWrite = nullptr;
        ASSERT_TRUE(::CreatePipe(&hRead, &hWrite, nullptr, 0));
        m_hRead.Reset(hRead);
        m_hWrite.Reset(hWrite);
        ASSERT_TRUE(m_child.Started());
    }

    void TearDown() override
    {
        m_threads.Stop();
        while (g_nExecDepth.load() > 0) LeaveExecDepth();
        DrainQuitRequests();
        EXPECT_EQ(TestPy_GilOwner(), 0u);
        EXPECT_EQ(TestPy_GilErrors(), 0);
        EXPECT_EQ(TestPy_EnsureCalls(), TestPy_ReleaseCalls());
    }

    void Start(HANDLE hClientProcess)
    {
        m_hClientProcess = hClientProcess;
        m_ullStart = ::GetTickCount64();
        ASSERT_TRUE(m_threads.Start(Runtime(), m_hRead.Get(), hClientProcess));
        m_hWatchdog.Reset(Duplicate(m_threads.WatchdogThread()));
    }

    // Waits for WM_REPL_QUIT; the milliseconds since Start, or -1.
    long long WaitForQuitRequest(DWORD dwMs)
    {
        ULONGLONG ullDeadline = ::GetTickCount64() + dwMs;
        for (;;) {
            MSG msg;
            if (::PeekMessageW(&msg, nullptr, WM_REPL_QUIT, WM_REPL_QUIT, PM_REMOVE)) {
                EXPECT_EQ(msg.wParam, 0u);
                EXPECT_EQ(msg.lParam, 0);
                EXPECT_EQ(msg.hwnd, nullptr);
                return static_cast<long long>(::GetTickCount64() - m_ullStart);
            }
            ULONGLONG ullNow = ::GetTickCount64();
            if (ullNow >= ullDeadline) return -1;
            ::MsgWaitForMultipleObjects(0, nullptr, FALSE, static_cast<DWORD>(ullDeadline - ullNow), QS_POSTMESSAGE);
        }
    }

    int DrainQuitRequests()
    {
        int nCount = 0;
        MSG msg;
        while (::PeekMessageW(&msg, nullptr, WM_REPL_QUIT, WM_REPL_QUIT, PM_REMOVE)) ++nCount;
        return nCount;
    }

    DWORD WatchdogExitCode()
    {
        DWORD dwCode = 0xDEAD;
        if (::WaitForSingleObject(m_hWatchdog.Get(), kWaitMs) == WAIT_OBJECT_0) {
            ::GetExitCodeThread(m_hWatchdog.Get(), &dwCode);
        }
        return dwCode;
    }

    CDebugCapture m_capture;
    CChildProcess m_child;
    CHandle m_hRead;
    CHandle m_hWrite;
    CHandle m_hWatchdog;
    HANDLE m_hClientProcess = nullptr;  // the watchdog's, not ours to close
    ULONGLONG m_ullStart = 0;
    CWorkerThreads m_threads;
};

}  // namespace

TEST_F(Watchdog, ClientThatEndsIsNoticedAtTheFirstCheckWithLogThenInterruptThenQuitRequest)
{
    CPythonThread python(m_capture);
    EnterExecDepth();  // a command runs on the main thread
    Start(m_child.Open(PROCESS_QUERY_INFORMATION));
    m_child.End(3);
    long long nElapsed = WaitForQuitRequest(kWaitMs);
    ASSERT_GE(nElapsed, 0) << "no quit request";
    EXPECT_GE(nElapsed, static_cast<long long>(kWatchdogPeriodMs) - 20);  // never before the first check
    EXPECT_LT(nElapsed, 2LL * kWatchdogPeriodMs);  // the first check saw it
    // By the time the request arrives, the line is out and the interrupt made.
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{Unavailable()});
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_TRUE(g_bInterrupted.load());
    EXPECT_EQ(python.WaitOutcome(), CPythonThread::kGotItAfterTheLogLine);
    EXPECT_EQ(WatchdogExitCode(), 0u);
    EXPECT_TRUE(HandleGone(m_hClientProcess, m_child.Id()));
    EXPECT_EQ(DrainQuitRequests(), 0);  // it acts once
}

TEST_F(Watchdog, HandleWithoutQueryRightLogsBothLinesAndActsOnIdleCode)
{
    Start(m_child.Open(SYNCHRONIZE));
    long long nElapsed = WaitForQuitRequest(kWaitMs);
    ASSERT_GE(nElapsed, 0) << "no quit request";
    EXPECT_GE(nElapsed, static_cast<long long>(kWatchdogPeriodMs) - 20);
    EXPECT_EQ(m_capture.Lines(),
              (std::vector<std::string>{LogLine("Cannot get exit code of client process"), Unavailable()}));
    // Idle: no command to interrupt, so no flag and no PyErr_SetInterrupt.
    EXPECT_EQ(TestPy_InterruptCalls(), 0);
    EXPECT_FALSE(g_bInterrupted.load());
    EXPECT_GE(TestPy_EnsureCalls(), 1);  // the other threads were reached
    EXPECT_EQ(WatchdogExitCode(), 0u);
    EXPECT_TRUE(HandleGone(m_hClientProcess, m_child.Id()));
}

TEST_F(Watchdog, ClientThatEndsWithCode259CountsAsRunning)
{
    m_child.End(STILL_ACTIVE);
    Start(m_child.Open(PROCESS_QUERY_INFORMATION));
    EXPECT_EQ(WaitForQuitRequest(kWatchdogPeriodMs + 1500), -1);
    EXPECT_TRUE(m_capture.Lines().empty());
    EXPECT_EQ(TestPy_EnsureCalls(), 0);
    m_threads.Stop();
    EXPECT_EQ(WatchdogExitCode(), 2u);
    EXPECT_TRUE(HandleGone(m_hClientProcess, m_child.Id()));
}

TEST_F(Watchdog, StopBeforeTheClientEndsLogsNothingPostsNothingAndClosesTheHandle)
{
    Start(m_child.Open(PROCESS_QUERY_INFORMATION));
    ::Sleep(50);
    m_threads.Stop();
    EXPECT_EQ(WatchdogExitCode(), 2u);
    m_child.End(1);
    EXPECT_EQ(DrainQuitRequests(), 0);
    EXPECT_TRUE(m_capture.Lines().empty());  // not even "ending it by force"
    EXPECT_EQ(TestPy_EnsureCalls(), 0);
    EXPECT_TRUE(HandleGone(m_hClientProcess, m_child.Id()));
}

TEST_F(Watchdog, StopWhileItWaitsForTheLockLetsItReleaseAndPostsNothing)
{
    struct LockHolder
    {
        HANDLE hHeld;
        HANDLE hLetGo;
        static unsigned __stdcall Proc(void* p)
        {
            auto* pHolder = static_cast<LockHolder*>(p);
            int nState = PyGILState_Ensure();
            ::SetEvent(pHolder->hHeld);
            ::WaitForSingleObject(pHolder->hLetGo, kWaitMs);
            PyGILState_Release(nState);
            return 0;
        }
    };
    struct Stopper
    {
        static unsigned __stdcall Proc(void* pThreads)
        {
            static_cast<CWorkerThreads*>(pThreads)->Stop();
            return 0;
        }
    };
    CHandle hHeld(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    CHandle hLetGo(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    LockHolder holder{hHeld.Get(), hLetGo.Get()};
    CHandle hHolder(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, LockHolder::Proc, &holder, 0, nullptr)));
    ASSERT_EQ(::WaitForSingleObject(hHeld.Get(), kWaitMs), WAIT_OBJECT_0);

    Start(m_child.Open(SYNCHRONIZE));  // the first check fails and it acts
    ULONGLONG ullDeadline = ::GetTickCount64() + kWaitMs;
    while (TestPy_EnsureCalls() < 2 && ::GetTickCount64() < ullDeadline) ::Sleep(5);
    bool bWaiting = TestPy_EnsureCalls() == 2;  // the watchdog waits in Ensure
    CHandle hStopper(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Stopper::Proc, &m_threads, 0, nullptr)));
    ::Sleep(100);
    ::SetEvent(hLetGo.Get());
    ASSERT_TRUE(bWaiting);
    ASSERT_EQ(::WaitForSingleObject(hStopper.Get(), kWaitMs), WAIT_OBJECT_0);
    ASSERT_EQ(::WaitForSingleObject(hHolder.Get(), kWaitMs), WAIT_OBJECT_0);
    EXPECT_EQ(WatchdogExitCode(), 2u);
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_EQ(DrainQuitRequests(), 0);
    EXPECT_EQ(m_capture.Lines(),
              (std::vector<std::string>{LogLine("Cannot get exit code of client process"), Unavailable()}));
    EXPECT_TRUE(HandleGone(m_hClientProcess, m_child.Id()));
}
