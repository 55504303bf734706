// The interrupt channel, driven through a real anonymous pipe: what each
// command byte does at each execution depth, the protocol errors, the
// lookups that can fail, and the cooperative stop of the worker threads.
#include <gtest/gtest.h>

#include <windows.h>
#include <process.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "common/Raii.h"
#include "host/RunState.h"
#include "py_double_api.h"
#include "python/Interrupt.h"
#include "python/WorkerThreads.h"
#include "server/ExecState.h"
#include "server/ReplServerImpl.h"
#include "support/DebugCapture.h"
#include "support/TestClient.h"

namespace {

constexpr DWORD kWaitMs = 10000;  // upper bound of every wait in this file

HMODULE Runtime() { return ::GetModuleHandleW(L"PyRuntimeDouble.dll"); }

std::string Unknown() { return LogLine("Interrupt: unknown command"); }

// A thread that runs a function and can be waited for with a timeout.
class CTestThread
{
public:
    explicit CTestThread(std::function<void()> fnBody) : m_fnBody(std::move(fnBody))
    {
        m_hThread.Reset(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Proc, this, 0, &m_nId)));
    }
    ~CTestThread()
    {
        if (m_hThread && !Join(kWaitMs)) {
            ::TerminateThread(m_hThread.Get(), 99);  // a failed test must not hang
        }
    }
    bool Started() const { return m_hThread.IsValid(); }
    DWORD Id() const { return m_nId; }
    bool Join(DWORD dwMs) { return ::WaitForSingleObject(m_hThread.Get(), dwMs) == WAIT_OBJECT_0; }

private:
    static unsigned __stdcall Proc(void* pThis)
    {
        static_cast<CTestThread*>(pThis)->m_fnBody();
        return 0;
    }
    std::function<void()> m_fnBody;
    unsigned m_nId = 0;
    CHandle m_hThread;
};

// A thread that runs "Python code": registered with the runtime double, it
// waits up to dwWaitMs for an asynchronous exception, then stays registered
// until asked whether it got one.
class CPythonThread
{
public:
    explicit CPythonThread(DWORD dwWaitMs = kWaitMs)
        : m_hReady(::CreateEventW(nullptr, TRUE, FALSE, nullptr)),
          m_hFinish(::CreateEventW(nullptr, TRUE, FALSE, nullptr)),
          m_thread([this, dwWaitMs] {
              TestPy_RegisterThread();
              ::SetEvent(m_hReady.Get());
              bool bGot = TestPy_WaitAsyncExc(dwWaitMs) == 1;
              ::WaitForSingleObject(m_hFinish.Get(), kWaitMs);
              m_bGotException = bGot || TestPy_CheckAsyncExc() == 1;
              TestPy_UnregisterThread();
          })
    {
        ::WaitForSingleObject(m_hReady.Get(), kWaitMs);
    }
    DWORD Id() const { return m_thread.Id(); }
    // True when the thread got the exception. Ends the thread.
    bool GotException()
    {
        ::SetEvent(m_hFinish.Get());
        return m_thread.Join(kWaitMs) && m_bGotException;
    }

private:
    CHandle m_hReady;
    CHandle m_hFinish;
    bool m_bGotException = false;
    CTestThread m_thread;
};

// The calls PyThreadState_SetAsyncExc received, in order.
std::vector<std::pair<DWORD, PyObject*>> AsyncCalls()
{
    std::vector<std::pair<DWORD, PyObject*>> vecCalls;
    for (int i = 0; i < TestPy_AsyncCallCount(); ++i) {
        DWORD dwThreadId = 0;
        PyObject* pExc = nullptr;
        TestPy_AsyncCall(i, &dwThreadId, &pExc);
        vecCalls.emplace_back(dwThreadId, pExc);
    }
    return vecCalls;
}

bool WasSentTo(DWORD dwThreadId)
{
    auto vecCalls = AsyncCalls();
    return std::any_of(vecCalls.begin(), vecCalls.end(),
                       [&](const auto& call) { return call.first == dwThreadId; });
}

HANDLE Duplicate(HANDLE h)
{
    HANDLE hCopy = nullptr;
    ::DuplicateHandle(::GetCurrentProcess(), h, ::GetCurrentProcess(), &hCopy, 0, FALSE, DUPLICATE_SAME_ACCESS);
    return hCopy;
}

DWORD ExitCodeAfterEnd(HANDLE hThread)
{
    DWORD dwCode = 0xDEAD;
    if (::WaitForSingleObject(hThread, kWaitMs) == WAIT_OBJECT_0) {
        ::GetExitCodeThread(hThread, &dwCode);
    }
    return dwCode;
}

class InterruptChannel : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_NE(Runtime(), nullptr);
        TestPy_Reset();
        g_dwMainThreadId = ::GetCurrentThreadId();
        HANDLE hRead = nullptr;
        HANDLE hWrite = nullptr;
        ASSERT_TRUE(::CreatePipe(&hRead, &hWrite, nullptr, 0));
        m_hRead.Reset(hRead);
        m_hWrite.Reset(hWrite);
    }

    void TearDown() override
    {
        m_threads.Stop();
        while (g_nExecDepth.load() > 0) LeaveExecDepth();
        EXPECT_EQ(TestPy_GilOwner(), 0u);
        EXPECT_EQ(TestPy_GilErrors(), 0);
        EXPECT_EQ(TestPy_LockViolations(), 0);
        EXPECT_EQ(TestPy_EnsureCalls(), TestPy_ReleaseCalls());
    }

    void StartThreads(HMODULE hPythonDLL)
    {
        HANDLE hSelf = ::OpenProcess(PROCESS_QUERY_INFORMATION, FALSE, ::GetCurrentProcessId());
        ASSERT_TRUE(m_threads.Start(hPythonDLL, m_hRead.Get(), hSelf));
        m_hInterruptThread.Reset(Duplicate(m_threads.InterruptThread()));
        m_hWatchdogThread.Reset(Duplicate(m_threads.WatchdogThread()));
    }

    void Write(const std::string& strBytes)
    {
        DWORD cbWritten = 0;
        ASSERT_TRUE(::WriteFile(m_hWrite.Get(), strBytes.data(), static_cast<DWORD>(strBytes.size()), &cbWritten,
                                nullptr));
        ASSERT_EQ(cbWritten, strBytes.size());
    }

    // Waits until the interrupt thread has taken everything written so far
    // out of the pipe and acted on it. Written once the pipe is empty, an
    // unknown command comes in a read of its own; its log line shows that
    // every earlier command is done. Adds that one line to the log.
    void Settle()
    {
        ULONGLONG ullDeadline = ::GetTickCount64() + kWaitMs;
        DWORD cbAvailable = 1;
        while (::PeekNamedPipe(m_hRead.Get(), nullptr, 0, nullptr, &cbAvailable, nullptr) && cbAvailable > 0 &&
               ::GetTickCount64() < ullDeadline) {
            ::Sleep(1);
        }
        ASSERT_EQ(cbAvailable, 0u);
        size_t nMarkers = Markers();
        Write("?");
        while (Markers() == nMarkers && ::GetTickCount64() < ullDeadline) ::Sleep(1);
        ASSERT_EQ(Markers(), nMarkers + 1);
    }

    size_t Markers() const
    {
        auto vecLines = m_capture.Lines();
        return static_cast<size_t>(std::count(vecLines.begin(), vecLines.end(), Unknown()));
    }

    void SendAndSettle(const std::string& strBytes)
    {
        Write(strBytes);
        Settle();
    }

    CDebugCapture m_capture;
    CHandle m_hRead;
    CHandle m_hWrite;
    CHandle m_hInterruptThread;  // our own handles, to read exit codes
    CHandle m_hWatchdogThread;
    CWorkerThreads m_threads;
};

}  // namespace

// ---- the main thread's command ------------------------------------------------

TEST_F(InterruptChannel, InterruptWhileIdleTakesNoLockSetsNothingLogsNothing)
{
    StartThreads(Runtime());
    SendAndSettle("a");
    EXPECT_EQ(TestPy_EnsureCalls(), 0);
    EXPECT_EQ(TestPy_InterruptCalls(), 0);
    EXPECT_FALSE(g_bInterrupted.load());
    EXPECT_FALSE(g_bInterruptPending.load());
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{Unknown()});
}

TEST_F(InterruptChannel, InterruptAtDepthOneRaisesOnceUnderTheLockAndAbortsTheCommand)
{
    StartThreads(Runtime());
    EnterExecDepth();
    SendAndSettle("a");
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_EQ(TestPy_LockViolations(), 0);  // raised with the lock held
    EXPECT_EQ(TestPy_EnsureCalls(), 1);
    EXPECT_TRUE(g_bInterrupted.load());
    EXPECT_FALSE(g_bInterruptPending.load());
    EXPECT_EQ(AsyncCalls().size(), 0u);  // "a" leaves other threads alone
    ExecLeaveResult leave = LeaveExecDepth();
    EXPECT_TRUE(leave.bInterrupted);
    EXPECT_FALSE(g_bInterrupted.load());  // the next command starts clean
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{Unknown()});
}

TEST_F(InterruptChannel, InterruptAtDepthTwoIsDeferredUntilTheInnerCommandEnds)
{
    StartThreads(Runtime());
    EnterExecDepth();
    EnterExecDepth();
    SendAndSettle("a");
    EXPECT_EQ(TestPy_InterruptCalls(), 0);
    EXPECT_TRUE(g_bInterrupted.load());
    EXPECT_TRUE(g_bInterruptPending.load());
    ExecLeaveResult inner = LeaveExecDepth();
    EXPECT_TRUE(inner.bInterrupted);
    EXPECT_TRUE(inner.bRaiseDeferred);
    ExecLeaveResult outer = LeaveExecDepth();
    EXPECT_TRUE(outer.bInterrupted);
    EXPECT_FALSE(outer.bRaiseDeferred);
}

TEST_F(InterruptChannel, TwoCommandsInOneReadActAsTheFirstAlone)
{
    StartThreads(Runtime());
    CPythonThread python(0);
    EnterExecDepth();
    SendAndSettle("ak");
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_FALSE(WasSentTo(python.Id()));  // the "k" was dropped
    EXPECT_FALSE(python.GotException());
}

// ---- every Python thread ----------------------------------------------------------

TEST_F(InterruptChannel, KillReachesEveryPythonThreadButNotTheMainOrInterruptThread)
{
    StartThreads(Runtime());
    ASSERT_EQ(TestPy_RegisterThread(), 1);  // the main thread runs Python code too
    std::vector<std::unique_ptr<CPythonThread>> vecThreads;
    for (int i = 0; i < 3; ++i) vecThreads.push_back(std::make_unique<CPythonThread>());
    SendAndSettle("k");
    for (auto& pThread : vecThreads) {
        EXPECT_TRUE(pThread->GotException()) << "thread " << pThread->Id();
    }
    PyObject* pKeyboardInterrupt = PyExc_KeyboardInterrupt;
    for (const auto& call : AsyncCalls()) {
        EXPECT_EQ(call.second, pKeyboardInterrupt);
        EXPECT_NE(call.first, ::GetCurrentThreadId());
        EXPECT_NE(call.first, ::GetThreadId(m_hInterruptThread.Get()));
    }
    EXPECT_EQ(TestPy_CheckAsyncExc(), 0);  // the main thread got none
    TestPy_UnregisterThread();
    // Idle: no command to interrupt, so no flag is set.
    EXPECT_EQ(TestPy_InterruptCalls(), 0);
    EXPECT_FALSE(g_bInterrupted.load());
}

TEST_F(InterruptChannel, KillAtDepthOneAlsoInterruptsTheMainThreadsCommand)
{
    StartThreads(Runtime());
    CPythonThread python;
    EnterExecDepth();
    SendAndSettle("k");
    EXPECT_TRUE(python.GotException());
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_TRUE(g_bInterrupted.load());
}

TEST_F(InterruptChannel, MoreThanOneStateChangedIsTakenBackWithNull)
{
    StartThreads(Runtime());
    TestPy_SetAsyncExcResult(2);
    CPythonThread python(0);
    SendAndSettle("k");
    auto vecCalls = AsyncCalls();
    auto it = std::find_if(vecCalls.begin(), vecCalls.end(), [&](const auto& c) { return c.first == python.Id(); });
    ASSERT_NE(it, vecCalls.end());
    EXPECT_EQ(it->second, PyExc_KeyboardInterrupt);
    ASSERT_NE(it + 1, vecCalls.end());
    EXPECT_EQ((it + 1)->first, python.Id());
    EXPECT_EQ((it + 1)->second, nullptr);
    EXPECT_FALSE(python.GotException());  // withdrawn before it could see it
}

TEST_F(InterruptChannel, SingleStateChangedIsNotTakenBack)
{
    StartThreads(Runtime());
    CPythonThread python;
    SendAndSettle("k");
    EXPECT_TRUE(python.GotException());
    for (const auto& call : AsyncCalls()) EXPECT_NE(call.second, nullptr);
}

// ---- the protocol ---------------------------------------------------------------

TEST_F(InterruptChannel, UnknownBytesAreLoggedAndTheThreadKeepsReading)
{
    StartThreads(Runtime());
    const std::string rgstrBytes[] = {std::string(1, '\0'), "A", "K"};
    size_t nLines = 0;
    for (const auto& strByte : rgstrBytes) {
        Write(strByte);
        ASSERT_TRUE(m_capture.WaitForCount(++nLines, kWaitMs));  // read on its own
    }
    EnterExecDepth();
    SendAndSettle("a");
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>(4, Unknown()));
    EXPECT_EQ(::WaitForSingleObject(m_hInterruptThread.Get(), 0), static_cast<DWORD>(WAIT_TIMEOUT));
}

TEST_F(InterruptChannel, FullBufferIsAProtocolErrorThatEndsTheThread)
{
    StartThreads(Runtime());
    EnterExecDepth();
    Write(std::string(256, 'a'));
    EXPECT_EQ(ExitCodeAfterEnd(m_hInterruptThread.Get()), 1u);
    EXPECT_EQ(TestPy_InterruptCalls(), 0);  // not even its first byte counts
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Error reading from interrupt pipe")});
}

TEST_F(InterruptChannel, ClosingTheWriteEndEndsTheThreadSilently)
{
    StartThreads(Runtime());
    m_hWrite.Reset();
    EXPECT_EQ(ExitCodeAfterEnd(m_hInterruptThread.Get()), 1u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(InterruptChannel, NoModuleLogsForEveryCommandEvenWhenIdle)
{
    StartThreads(nullptr);
    SendAndSettle("a");
    SendAndSettle("k");
    EXPECT_EQ(m_capture.Lines(), (std::vector<std::string>{LogLine("No Python module given"), Unknown(),
                                                           LogLine("No Python module given"), Unknown()}));
}

// ---- entry points that cannot be found ----------------------------------------------

TEST(InterruptPython, NoModuleLogsItsLine)
{
    CDebugCapture capture;
    InterruptPython(nullptr, false);
    EXPECT_EQ(capture.Lines(), std::vector<std::string>{LogLine("No Python module given")});
}

TEST(InterruptPython, NoLockFunctionsLogTheirLineAndSetNothing)
{
    CDebugCapture capture;
    EnterExecDepth();
    InterruptPython(::GetModuleHandleW(L"kernel32.dll"), true);
    EXPECT_FALSE(g_bInterrupted.load());
    LeaveExecDepth();
    EXPECT_EQ(capture.Lines(), std::vector<std::string>{LogLine("No Python functions found to lock the GIL state")});
}

TEST(InterruptPython, NoSetInterruptLogsItsLineKeepsTheFlagAndStillReachesOtherThreads)
{
    HMODULE hNoInterrupt = ::LoadLibraryW(L"PyRuntimeNoInterrupt.dll");
    ASSERT_NE(hNoInterrupt, nullptr);
    auto pfnRegister = PYDOUBLE_PROC(hNoInterrupt, TestPy_RegisterThread);
    auto pfnUnregister = PYDOUBLE_PROC(hNoInterrupt, TestPy_UnregisterThread);
    auto pfnAsyncCallCount = PYDOUBLE_PROC(hNoInterrupt, TestPy_AsyncCallCount);
    auto pfnGilOwner = PYDOUBLE_PROC(hNoInterrupt, TestPy_GilOwner);
    PYDOUBLE_PROC(hNoInterrupt, TestPy_Reset)();
    g_dwMainThreadId = ::GetCurrentThreadId();
    CHandle hRegistered(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    CHandle hDone(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    CTestThread python([&] {
        pfnRegister();
        ::SetEvent(hRegistered.Get());
        ::WaitForSingleObject(hDone.Get(), kWaitMs);
        pfnUnregister();
    });
    ASSERT_EQ(::WaitForSingleObject(hRegistered.Get(), kWaitMs), WAIT_OBJECT_0);
    CDebugCapture capture;
    EnterExecDepth();
    InterruptPython(hNoInterrupt, true);
    EXPECT_TRUE(g_bInterrupted.load());
    EXPECT_TRUE(LeaveExecDepth().bInterrupted);
    ::SetEvent(hDone.Get());
    EXPECT_GE(pfnAsyncCallCount(), 1);
    EXPECT_EQ(pfnGilOwner(), 0u);
    EXPECT_EQ(capture.Lines(),
              std::vector<std::string>{LogLine("No Python functions found to interrupt main thread")});
    EXPECT_TRUE(python.Join(kWaitMs));
    ::FreeLibrary(hNoInterrupt);
}

TEST(InterruptPython, NoKeyboardInterruptLogsItsLineAfterTheMainThreadPart)
{
    TestPy_Reset();
    TestPy_SetKeyboardInterruptNull(1);
    CDebugCapture capture;
    EnterExecDepth();
    InterruptPython(Runtime(), true);
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    EXPECT_EQ(TestPy_AsyncCallCount(), 0);
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    LeaveExecDepth();
    TestPy_SetKeyboardInterruptNull(0);
    EXPECT_EQ(capture.Lines(),
              std::vector<std::string>{LogLine("No Python functions found to interrupt all threads")});
}

// ---- the cooperative stop -------------------------------------------------------------

TEST_F(InterruptChannel, StopEndsBothThreadsWithCodeTwoWithoutForce)
{
    StartThreads(Runtime());
    m_threads.Stop();
    EXPECT_EQ(ExitCodeAfterEnd(m_hInterruptThread.Get()), 2u);
    EXPECT_EQ(ExitCodeAfterEnd(m_hWatchdogThread.Get()), 2u);
    EXPECT_EQ(m_threads.InterruptThread(), nullptr);
    EXPECT_EQ(m_threads.WatchdogThread(), nullptr);
    EXPECT_TRUE(m_capture.Lines().empty());  // no "ending it by force"
}

TEST_F(InterruptChannel, StopRightAfterStartEndsWithoutForceEveryTime)
{
    // The stop may come before the thread has reached its first read.
    for (int i = 0; i < 40; ++i) {
        StartThreads(Runtime());
        m_threads.Stop();
        ASSERT_EQ(ExitCodeAfterEnd(m_hInterruptThread.Get()), 2u) << "round " << i;
    }
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(InterruptChannel, StopWhileTheThreadWaitsForTheLockLetsItFinishAndRelease)
{
    StartThreads(Runtime());
    EnterExecDepth();
    // Another thread holds the interpreter lock, so the interrupt waits for it.
    CHandle hHeld(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    CHandle hLetGo(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    CTestThread holder([&] {
        int nState = PyGILState_Ensure();
        ::SetEvent(hHeld.Get());
        ::WaitForSingleObject(hLetGo.Get(), kWaitMs);
        PyGILState_Release(nState);
    });
    ASSERT_EQ(::WaitForSingleObject(hHeld.Get(), kWaitMs), WAIT_OBJECT_0);
    Write("a");
    ULONGLONG ullDeadline = ::GetTickCount64() + kWaitMs;
    while (TestPy_EnsureCalls() < 2 && ::GetTickCount64() < ullDeadline) ::Sleep(1);
    ASSERT_EQ(TestPy_EnsureCalls(), 2);  // the interrupt thread waits in Ensure now
    CTestThread stopper([&] { m_threads.Stop(); });
    ::Sleep(100);
    ::SetEvent(hLetGo.Get());
    ASSERT_TRUE(stopper.Join(kWaitMs));
    EXPECT_EQ(ExitCodeAfterEnd(m_hInterruptThread.Get()), 2u);
    EXPECT_EQ(TestPy_InterruptCalls(), 1);  // it finished what it had begun
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(InterruptChannel, AHandleThatIsNoPipeEndsTheThreadSilently)
{
    // A pipe handle that is not a pipe still starts the thread: the read
    // fails and the thread ends with code 1, silently.
    CHandle hEvent(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    HANDLE hSelf = ::OpenProcess(PROCESS_QUERY_INFORMATION, FALSE, ::GetCurrentProcessId());
    ASSERT_TRUE(m_threads.Start(Runtime(), hEvent.Get(), hSelf));
    CHandle hThread(Duplicate(m_threads.InterruptThread()));
    EXPECT_EQ(ExitCodeAfterEnd(hThread.Get()), 1u);
    m_threads.Stop();
    EXPECT_TRUE(m_capture.Lines().empty());
}

// ---- the command that the interrupt aborts ------------------------------------------

namespace {

HANDLE g_hCommandPipe = nullptr;

// Sends "a" through the pipe, then waits like Python code until the
// interrupt arrives, and fails the way an uncaught KeyboardInterrupt does.
int __cdecl InterruptedCommand(BSTR, BSTR, BSTR* pResult)
{
    DWORD cbWritten = 0;
    ::WriteFile(g_hCommandPipe, "a", 1, &cbWritten, nullptr);
    if (TestPy_WaitInterrupt(kWaitMs) != 1) return 0;
    KxReplSetResult(pResult, L"KeyboardInterrupt");
    return 1;
}

}  // namespace

TEST_F(InterruptChannel, CommandInterruptedThroughThePipeEndsWithEAbort)
{
    StartThreads(Runtime());
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CTestClient* pClient = CTestClient::Create();
    ASSERT_NE(pClient, nullptr);
    CComObject<KxCIReplServerImpl>* pServer = nullptr;
    ASSERT_EQ(CreateServerObject(&pServer), S_OK);
    pServer->AddRef();
    ASSERT_EQ(pServer->Init(pClient, Runtime(), ::GetModuleHandleW(L"PyComDouble.dll"), InterruptedCommand, nullptr),
              S_OK);
    g_hCommandPipe = m_hWrite.Get();
    CComBSTR bstrCommand(L"spin");
    BSTR bstrResult = nullptr;
    EXPECT_EQ(pServer->Exec(bstrCommand, nullptr, &bstrResult), E_ABORT);
    EXPECT_EQ(TestPy_InterruptCalls(), 1);
    ::SysFreeString(bstrResult);
    // The next command runs normally: the flags were cleared.
    EXPECT_FALSE(g_bInterrupted.load());
    pServer->Quit();
    pServer->Release();
    pClient->Release();
    MSG msg;
    while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
    }
}
