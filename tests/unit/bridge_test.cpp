// The output and input bridge: printing from the main thread and from any
// other thread, the flush and its re-entry, input, quitting, the result and
// string helpers, and what happens when a copy cannot be allocated. The
// client is the in-process recording test client.
#include <gtest/gtest.h>

#include <windows.h>
#include <objbase.h>
#include <process.h>

#include <atomic>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <new>
#include <set>
#include <string>
#include <vector>

#include "common/Raii.h"
#include "host/Bridge.h"
#include "host/KxRepl.h"
#include "host/RunState.h"
#include "py_double_api.h"
#include "server/ReplServerImpl.h"
#include "support/DebugCapture.h"
#include "support/TestClient.h"

// ---- failing allocations -----------------------------------------------------------

namespace {
// When positive on a thread, the allocation that brings it to 0 fails.
thread_local int t_nFailAllocationIn = 0;
}  // namespace

// On the process heap rather than malloc, so that the compiler does not
// pair these with the C runtime's own functions.
void* operator new(std::size_t cb)
{
    if (t_nFailAllocationIn > 0 && --t_nFailAllocationIn == 0) {
        throw std::bad_alloc();
    }
    void* p = ::HeapAlloc(::GetProcessHeap(), 0, cb != 0 ? cb : 1);
    if (p == nullptr) throw std::bad_alloc();
    return p;
}

void operator delete(void* p) noexcept
{
    if (p != nullptr) ::HeapFree(::GetProcessHeap(), 0, p);
}

void operator delete(void* p, std::size_t) noexcept
{
    operator delete(p);
}

namespace {

constexpr DWORD kWaitMs = 10000;  // upper bound of every wait in this file
constexpr HRESULT kClientUnavailable = static_cast<HRESULT>(0x800706BA);

// Loaded by name: nothing here links against them.
HMODULE Runtime()
{
    static HMODULE s_hModule = ::LoadLibraryW(L"PyRuntimeDouble.dll");
    return s_hModule;
}

HMODULE ComSupport()
{
    static HMODULE s_hModule = ::LoadLibraryW(L"PyComDouble.dll");
    return s_hModule;
}

// Watches the task allocator, which holds every BSTR. Only blocks of at
// least kBigBytes are tracked: smaller strings may be served from the
// string cache and never reach the allocator.
class CAllocationSpy final : public IMallocSpy
{
public:
    static constexpr SIZE_T kBigBytes = 64 * 1024;

    long LiveBigBlocks()
    {
        CSrwExclusiveLock lock(&m_srw);
        return static_cast<long>(m_setLive.size());
    }
    // The next big allocation fails.
    void FailNextBigAllocation() { m_bFailNext = true; }

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        if (::IsEqualIID(riid, IID_IUnknown) || ::IsEqualIID(riid, IID_IMallocSpy)) {
            *ppv = static_cast<IMallocSpy*>(this);
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHOD_(ULONG, AddRef)() override { return 2; }  // static lifetime
    STDMETHOD_(ULONG, Release)() override { return 1; }
    STDMETHOD_(SIZE_T, PreAlloc)(SIZE_T cbRequest) override
    {
        t_cbRequest = cbRequest;
        if (cbRequest >= kBigBytes && m_bFailNext.exchange(false)) {
            return 0;  // the allocator then fails the request
        }
        return cbRequest;
    }
    STDMETHOD_(void*, PostAlloc)(void* pActual) override
    {
        if (pActual == nullptr || t_cbRequest < kBigBytes) return pActual;
        CSrwExclusiveLock lock(&m_srw);
        m_setLive.insert(pActual);
        return pActual;
    }
    STDMETHOD_(void*, PreFree)(void* pRequest, BOOL) override
    {
        CSrwExclusiveLock lock(&m_srw);
        m_setLive.erase(pRequest);
        return pRequest;
    }
    STDMETHOD_(void, PostFree)(BOOL) override {}
    STDMETHOD_(SIZE_T, PreRealloc)(void* pRequest, SIZE_T cbRequest, void** ppNewRequest, BOOL) override
    {
        *ppNewRequest = pRequest;
        return cbRequest;
    }
    STDMETHOD_(void*, PostRealloc)(void* pActual, BOOL) override { return pActual; }
    STDMETHOD_(void*, PreGetSize)(void* pRequest, BOOL) override { return pRequest; }
    STDMETHOD_(SIZE_T, PostGetSize)(SIZE_T cbActual, BOOL) override { return cbActual; }
    STDMETHOD_(void*, PreDidAlloc)(void* pRequest, BOOL) override { return pRequest; }
    STDMETHOD_(int, PostDidAlloc)(void*, BOOL, int fActual) override { return fActual; }
    STDMETHOD_(void, PreHeapMinimize)() override {}
    STDMETHOD_(void, PostHeapMinimize)() override {}

private:
    static thread_local SIZE_T t_cbRequest;
    SRWLOCK m_srw = SRWLOCK_INIT;
    std::set<void*> m_setLive;
    std::atomic<bool> m_bFailNext{false};
};

thread_local SIZE_T CAllocationSpy::t_cbRequest = 0;

// Registered once for the rest of the program: a revoke is refused while
// blocks allocated under the spy are still alive.
CAllocationSpy& Spy()
{
    static CAllocationSpy s_spy;
    static HRESULT s_hr = [] {
        HRESULT hr = ::CoRegisterMallocSpy(&s_spy);
        // Wine's allocator looks every freed block up in its table of spied
        // blocks, and faults while that table has not been made yet: one
        // spied allocation makes it.
        ::CoTaskMemFree(::CoTaskMemAlloc(1));
        return hr;
    }();
    EXPECT_EQ(s_hr, S_OK);
    return s_spy;
}

// A text whose BSTR copy is a big block.
std::wstring BigText(wchar_t ch)
{
    return std::wstring(CAllocationSpy::kBigBytes / sizeof(wchar_t) + 100, ch);
}

// Runs a function on another thread and waits for it.
bool RunOnOtherThread(std::function<void()> fnBody)
{
    struct Ctx
    {
        std::function<void()> fn;
        static unsigned __stdcall Proc(void* p)
        {
            static_cast<Ctx*>(p)->fn();
            return 0;
        }
    } ctx{std::move(fnBody)};
    CHandle hThread(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Ctx::Proc, &ctx, 0, nullptr)));
    if (!hThread) return false;
    if (::WaitForSingleObject(hThread.Get(), kWaitMs) != WAIT_OBJECT_0) {
        ::TerminateThread(hThread.Get(), 99);  // a failed test must not hang
        return false;
    }
    return true;
}

// The command the server runs; each test sets what it does.
std::function<int(BSTR* pResult)> g_fnCommand;

int __cdecl RunCommand(BSTR, BSTR, BSTR* pResult)
{
    return g_fnCommand ? g_fnCommand(pResult) : 0;
}

size_t QueuedRecords()
{
    CCritSecLock lock(&g_csOutputQueue);
    return g_OutputQueue.size();
}

// Counts and removes the wake-ups in this thread's queue. (A peek for one
// message number also returns a pending WM_QUIT, which is dropped here.)
int RemovePostedPaints()
{
    int nCount = 0;
    MSG msg;
    while (::PeekMessageW(&msg, nullptr, WM_PAINT, WM_PAINT, PM_REMOVE)) {
        if (msg.message != WM_PAINT) continue;
        EXPECT_EQ(msg.hwnd, nullptr);
        EXPECT_EQ(msg.wParam, 0u);
        EXPECT_EQ(msg.lParam, 0);
        ++nCount;
    }
    return nCount;
}

class Bridge : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ASSERT_NE(Runtime(), nullptr);
        ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
        g_dwMainThreadId = ::GetCurrentThreadId();
        MSG msg;
        ::PeekMessageW(&msg, nullptr, 0, 0, PM_NOREMOVE);  // a queue for the wake-ups
        ASSERT_TRUE(OpenOutputQueue());
        m_pClient = CTestClient::Create();
        ASSERT_NE(m_pClient, nullptr);
        ASSERT_EQ(CreateServerObject(&m_pServer), S_OK);
        m_pServer->AddRef();
        HRESULT hr = m_pServer->Init(m_pClient, Runtime(), ComSupport(), RunCommand, nullptr);
        m_pServer->Release();  // the run's own reference keeps it now
        ASSERT_EQ(hr, S_OK);
        ASSERT_EQ(g_pCurrentServer, m_pServer);
        m_pClient->ClearCalls();
    }

    void TearDown() override
    {
        if (g_pCurrentServer != nullptr) g_pCurrentServer->Quit();
        CloseOutputQueue();
        g_fnCommand = nullptr;
        MSG msg;
        while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
        }
        if (m_pClient != nullptr) m_pClient->Release();
        ::CoUninitialize();
    }

    struct Printed
    {
        std::wstring strText;
        LONG nIsError;
        bool operator==(const Printed& other) const
        {
            return strText == other.strText && nIsError == other.nIsError;
        }
    };

    // What the client's Print received, in order.
    std::vector<Printed> PrintedByClient() const
    {
        std::vector<Printed> vecPrinted;
        for (const auto& call : m_pClient->CallsOf(CTestClient::DISPID_PRINT)) {
            if (call.args.size() == 2) vecPrinted.push_back({call.args[1].strText, call.args[0].nValue});
        }
        return vecPrinted;
    }

    std::vector<std::wstring> PrintedTexts() const
    {
        std::vector<std::wstring> vecTexts;
        for (const auto& printed : PrintedByClient()) vecTexts.push_back(printed.strText);
        return vecTexts;
    }

    void PrintOnOtherThread(std::vector<std::wstring> vecTexts)
    {
        ASSERT_TRUE(RunOnOtherThread([&] {
            for (const auto& strText : vecTexts) KxReplPrint(strText.c_str(), FALSE);
        }));
    }

    CDebugCapture m_capture;
    CTestClient* m_pClient = nullptr;
    CComObject<KxCIReplServerImpl>* m_pServer = nullptr;
};

}  // namespace

// ---- printing on the main thread -----------------------------------------------------

TEST_F(Bridge, MainThreadPrintCallsTheClientsPrintWithTheExactLayout)
{
    KxReplPrint(L"hello\n", FALSE);
    auto vecCalls = m_pClient->CallsOf(CTestClient::DISPID_PRINT);
    ASSERT_EQ(vecCalls.size(), 1u);
    const auto& call = vecCalls[0];
    EXPECT_EQ(call.dwThreadId, ::GetCurrentThreadId());
    EXPECT_TRUE(call.bRiidNull);
    EXPECT_EQ(call.lcid, static_cast<LCID>(0x0400));
    EXPECT_EQ(call.wFlags, DISPATCH_METHOD);
    EXPECT_EQ(call.cArgs, 2u);
    EXPECT_EQ(call.cNamedArgs, 0u);
    EXPECT_TRUE(call.bNamedArgsNull);
    EXPECT_TRUE(call.bResultNull);
    EXPECT_TRUE(call.bExcepInfoNull);
    EXPECT_TRUE(call.bArgErrNull);
    ASSERT_EQ(call.args.size(), 2u);
    EXPECT_EQ(call.args[0].vt, VT_BOOL);
    EXPECT_EQ(call.args[0].nValue, VARIANT_FALSE);
    EXPECT_EQ(call.args[1].vt, VT_BSTR);
    EXPECT_EQ(call.args[1].strText, L"hello\n");
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, AnyNonZeroErrorFlagArrivesAsVariantTrue)
{
    KxReplPrint(L"one", 1);
    KxReplPrint(L"two", 2);
    KxReplPrint(L"three", -5);
    KxReplPrint(L"four", 0);
    EXPECT_EQ(PrintedByClient(), (std::vector<Printed>{{L"one", -1}, {L"two", -1}, {L"three", -1}, {L"four", 0}}));
}

TEST_F(Bridge, NullOrEmptyTextDoesNothingNotEvenAFlush)
{
    PrintOnOtherThread({L"queued"});
    KxReplPrint(nullptr, FALSE);
    KxReplPrint(L"", TRUE);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);
    EXPECT_EQ(QueuedRecords(), 1u);
    RunOnOtherThread([] {
        KxReplPrint(nullptr, FALSE);
        KxReplPrint(L"", FALSE);
    });
    EXPECT_EQ(QueuedRecords(), 1u);
    EXPECT_EQ(RemovePostedPaints(), 1);  // only the one real record woke the loop
    EXPECT_TRUE(m_capture.Lines().empty());
}

// ---- printing on other threads ---------------------------------------------------------

TEST_F(Bridge, OtherThreadsQueueAndWakeTheMainThreadOncePerRecord)
{
    PrintOnOtherThread({L"one", L"two"});
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);  // never from that thread
    EXPECT_EQ(QueuedRecords(), 2u);
    EXPECT_EQ(RemovePostedPaints(), 2);
}

TEST_F(Bridge, QueuedRecordsGoOutBeforeTheNextMainThreadPrint)
{
    PrintOnOtherThread({L"one", L"two"});
    KxReplPrint(L"three", FALSE);
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"one", L"two", L"three"}));
    for (const auto& call : m_pClient->CallsOf(CTestClient::DISPID_PRINT)) {
        EXPECT_EQ(call.dwThreadId, ::GetCurrentThreadId());
    }
    EXPECT_EQ(QueuedRecords(), 0u);
}

TEST_F(Bridge, FlushSendsQueuedRecordsWithTheirFlagsInOrderThenEmptiesTheQueue)
{
    ASSERT_TRUE(RunOnOtherThread([] {
        KxReplPrint(L"out", FALSE);
        KxReplPrint(L"err", TRUE);
    }));
    FlushQueuedOutput();
    EXPECT_EQ(PrintedByClient(), (std::vector<Printed>{{L"out", 0}, {L"err", -1}}));
    EXPECT_EQ(QueuedRecords(), 0u);
    FlushQueuedOutput();
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 2u);  // nothing twice
}

TEST_F(Bridge, ManyThreadsPrintingAtOnceLoseNothingAndKeepEachThreadsOrder)
{
    constexpr int kThreads = 8;
    constexpr int kPrints = 150;
    std::atomic<int> nDone{0};
    struct Worker
    {
        int nIndex;
        std::atomic<int>* pDone;
        static unsigned __stdcall Proc(void* p)
        {
            auto* pWorker = static_cast<Worker*>(p);
            for (int n = 0; n < kPrints; ++n) {
                std::wstring strText = std::to_wstring(pWorker->nIndex) + L":" + std::to_wstring(n);
                KxReplPrint(strText.c_str(), n % 2);
            }
            ++*pWorker->pDone;
            return 0;
        }
    };
    std::vector<Worker> vecWorkers;
    for (int i = 0; i < kThreads; ++i) vecWorkers.push_back({i, &nDone});
    std::vector<CHandle> vecThreads;
    for (auto& worker : vecWorkers) {
        vecThreads.emplace_back(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Worker::Proc, &worker, 0, nullptr)));
    }
    // The main thread flushes while they print, as the main loop would.
    ULONGLONG ullDeadline = ::GetTickCount64() + kWaitMs;
    while (nDone.load() < kThreads && ::GetTickCount64() < ullDeadline) FlushQueuedOutput();
    for (auto& hThread : vecThreads) ASSERT_EQ(::WaitForSingleObject(hThread.Get(), kWaitMs), WAIT_OBJECT_0);
    FlushQueuedOutput();

    std::map<int, int> mapNext;
    for (const auto& printed : PrintedByClient()) {
        size_t nColon = printed.strText.find(L':');
        ASSERT_NE(nColon, std::wstring::npos);
        int nThread = std::stoi(printed.strText.substr(0, nColon));
        int n = std::stoi(printed.strText.substr(nColon + 1));
        EXPECT_EQ(n, mapNext[nThread]) << "thread " << nThread;
        EXPECT_EQ(printed.nIsError, n % 2 ? -1 : 0);
        mapNext[nThread] = n + 1;
    }
    for (int i = 0; i < kThreads; ++i) EXPECT_EQ(mapNext[i], kPrints) << "thread " << i;
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), static_cast<size_t>(kThreads * kPrints));
}

// ---- the flush re-entered ------------------------------------------------------------------

TEST_F(Bridge, FlushReenteredDuringAClientCallNeitherRepeatsNorLosesNorReorders)
{
    // While the client handles "A" it runs a nested command that prints on
    // the main thread, which flushes again inside the outer flush.
    bool bNested = false;
    m_pClient->SetHook(CTestClient::DISPID_PRINT, [&](const CTestClient::Call& call) {
        if (!bNested && call.args.size() == 2 && call.args[1].strText == L"A") {
            bNested = true;
            KxReplPrint(L"nested", FALSE);
        }
        return S_FALSE;
    });
    PrintOnOtherThread({L"A", L"B", L"C", L"D"});
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"A", L"B", L"C", L"D", L"nested"}));
    EXPECT_EQ(QueuedRecords(), 0u);
}

TEST_F(Bridge, FlushReenteredAtTheLastRecordEndsBothWalksCleanly)
{
    int nDepth = 0;
    m_pClient->SetHook(CTestClient::DISPID_PRINT, [&](const CTestClient::Call& call) {
        if (nDepth == 0 && call.args.size() == 2 && call.args[1].strText == L"B") {
            ++nDepth;
            FlushQueuedOutput();  // nothing left for it
            KxReplPrint(L"nested", FALSE);
        }
        return S_FALSE;
    });
    PrintOnOtherThread({L"A", L"B"});
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"A", L"B", L"nested"}));
}

TEST_F(Bridge, OtherThreadsPrintingDuringAFlushWaitAndComeNext)
{
    // The lock is held across the client call: a print of another thread
    // made meanwhile is queued after the flush and sent by the next one.
    bool bStarted = false;
    CHandle hPrinted(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    m_pClient->SetHook(CTestClient::DISPID_PRINT, [&](const CTestClient::Call&) {
        if (!bStarted) {
            bStarted = true;
            struct Late
            {
                static unsigned __stdcall Proc(void* hDone)
                {
                    KxReplPrint(L"late", FALSE);
                    ::SetEvent(hDone);
                    return 0;
                }
            };
            CHandle hThread(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Late::Proc, hPrinted.Get(), 0, nullptr)));
            // It cannot finish while this flush holds the lock.
            EXPECT_EQ(::WaitForSingleObject(hPrinted.Get(), 200), static_cast<DWORD>(WAIT_TIMEOUT));
        }
        return S_FALSE;
    });
    PrintOnOtherThread({L"first"});
    FlushQueuedOutput();
    ASSERT_EQ(::WaitForSingleObject(hPrinted.Get(), kWaitMs), WAIT_OBJECT_0);
    EXPECT_EQ(PrintedTexts(), std::vector<std::wstring>{L"first"});
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"first", L"late"}));
}

// ---- failed client calls -------------------------------------------------------------------

TEST_F(Bridge, FailedPrintKeepsTheServerRunningAndTheLastFailureBecomesTheResult)
{
    int nPrint = 0;
    m_pClient->SetHook(CTestClient::DISPID_PRINT, [&](const CTestClient::Call&) {
        ++nPrint;
        return nPrint == 1 ? E_FAIL : nPrint == 2 ? DISP_E_TYPEMISMATCH : S_OK;
    });
    g_fnCommand = [](BSTR* pResult) {
        KxReplPrint(L"one", FALSE);
        KxReplPrint(L"two", FALSE);
        KxReplPrint(L"three", FALSE);  // succeeds: the failure stays
        KxReplSetResult(pResult, L"done");
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    BSTR bstrResult = nullptr;
    EXPECT_EQ(m_pServer->Exec(bstrCommand, nullptr, &bstrResult), DISP_E_TYPEMISMATCH);
    EXPECT_STREQ(bstrResult, L"done");
    ::SysFreeString(bstrResult);
    EXPECT_EQ(g_pCurrentServer, m_pServer);
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"one", L"two", L"three"}));
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>(2, LogLine("Client call of Print failed")));
}

TEST_F(Bridge, UnavailableClientIsLoggedOnceQuitsAndStopsTheFlush)
{
    m_pClient->SetResult(CTestClient::DISPID_PRINT, kClientUnavailable);
    PrintOnOtherThread({L"one", L"two", L"three"});
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), std::vector<std::wstring>{L"one"});
    EXPECT_EQ(g_pCurrentServer, nullptr);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_DETACH), 1u);
    EXPECT_EQ(QueuedRecords(), 0u);  // the rest was discarded
    // Later output is dropped without a word, from any thread.
    KxReplPrint(L"after", FALSE);
    PrintOnOtherThread({L"later"});
    FlushQueuedOutput();
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 1u);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Client is unavailable, quitting")});
}

TEST_F(Bridge, UnavailableClientDoesNotCountAsAPrintFailureOfTheCommand)
{
    m_pClient->SetResult(CTestClient::DISPID_PRINT, kClientUnavailable);
    m_pServer->AddRef();  // keep it past its Quit to run the command
    g_fnCommand = [](BSTR*) {
        KxReplPrint(L"one", FALSE);
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    BSTR bstrResult = nullptr;
    EXPECT_EQ(m_pServer->Exec(bstrCommand, nullptr, &bstrResult), S_OK);
    EXPECT_EQ(g_pCurrentServer, nullptr);
    m_pServer->Release();
}

TEST_F(Bridge, ClientThatQuitsTheServerInsidePrintEndsTheFlush)
{
    // The client calls Quit while it handles the first record; the object
    // must stay alive until that Print call has returned.
    m_pClient->SetHook(CTestClient::DISPID_PRINT, [&](const CTestClient::Call&) {
        if (g_pCurrentServer != nullptr) g_pCurrentServer->Quit();
        return S_OK;
    });
    PrintOnOtherThread({L"one", L"two"});
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), std::vector<std::wstring>{L"one"});
    EXPECT_EQ(g_pCurrentServer, nullptr);
    EXPECT_EQ(QueuedRecords(), 0u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

// ---- outside a run -----------------------------------------------------------------------

TEST_F(Bridge, PrintOutsideARunIsDroppedFromAnyThreadWithoutTouchingTheLock)
{
    g_pCurrentServer->Quit();
    CloseOutputQueue();  // the lock is gone now, as after a teardown
    // Whoever entered the deleted lock now would hang or crash on this.
    std::memset(&g_csOutputQueue, 0xCD, sizeof(g_csOutputQueue));
    KxReplPrint(L"main", FALSE);
    PrintOnOtherThread({L"other"});
    EXPECT_EQ(RemovePostedPaints(), 0);
    FlushQueuedOutput();
    // Before the first run no thread is the main thread.
    g_dwMainThreadId = 0;
    KxReplPrint(L"before", FALSE);
    EXPECT_EQ(RemovePostedPaints(), 0);
    g_dwMainThreadId = ::GetCurrentThreadId();
    // A new run's queue starts empty.
    ASSERT_TRUE(OpenOutputQueue());
    EXPECT_EQ(QueuedRecords(), 0u);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{});
}

TEST_F(Bridge, TeardownDiscardsQueuedOutputUnsent)
{
    PrintOnOtherThread({L"one", L"two"});
    CloseOutputQueue();
    ASSERT_TRUE(OpenOutputQueue());
    FlushQueuedOutput();
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);
}

TEST_F(Bridge, PrintOnTheMainThreadWithNoServerStillFlushesAndDrops)
{
    PrintOnOtherThread({L"queued"});
    g_pCurrentServer->Quit();
    KxReplPrint(L"main", FALSE);
    EXPECT_EQ(QueuedRecords(), 0u);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, PrintsFromManyThreadsRacingATeardownNeverCrash)
{
    // Threads print while the main thread closes and reopens the queue.
    std::atomic<bool> bStop{false};
    struct Printer
    {
        static unsigned __stdcall Proc(void* p)
        {
            auto* pStop = static_cast<std::atomic<bool>*>(p);
            while (!pStop->load()) KxReplPrint(L"racing", FALSE);
            return 0;
        }
    };
    std::vector<CHandle> vecThreads;
    for (int i = 0; i < 4; ++i) {
        vecThreads.emplace_back(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, Printer::Proc, &bStop, 0, nullptr)));
    }
    for (int i = 0; i < 200; ++i) {
        CloseOutputQueue();
        ASSERT_TRUE(OpenOutputQueue());
    }
    bStop = true;
    for (auto& hThread : vecThreads) ASSERT_EQ(::WaitForSingleObject(hThread.Get(), kWaitMs), WAIT_OBJECT_0);
    FlushQueuedOutput();
    EXPECT_EQ(QueuedRecords(), 0u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

// ---- copies that cannot be allocated ---------------------------------------------------------

TEST_F(Bridge, QueueCopyThatCannotBeAllocatedDropsOnlyThatRecordWithItsOwnLine)
{
    ASSERT_TRUE(RunOnOtherThread([] {
        KxReplPrint(L"first record, long enough to need the heap", FALSE);
        t_nFailAllocationIn = 1;
        KxReplPrint(L"second record, long enough to need the heap", FALSE);
        t_nFailAllocationIn = 0;
        KxReplPrint(L"third record, long enough to need the heap", FALSE);
    }));
    FlushQueuedOutput();
    EXPECT_EQ(PrintedTexts(), (std::vector<std::wstring>{L"first record, long enough to need the heap",
                                                         L"third record, long enough to need the heap"}));
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Cannot copy output text, dropped")});
    EXPECT_EQ(RemovePostedPaints(), 2);
}

TEST_F(Bridge, PrintArgumentThatCannotBeAllocatedDropsOnlyThatPrintWithItsOwnLine)
{
    CAllocationSpy& spy = Spy();
    spy.FailNextBigAllocation();
    KxReplPrint(BigText(L'x').c_str(), FALSE);
    KxReplPrint(L"next", FALSE);
    EXPECT_EQ(PrintedTexts(), std::vector<std::wstring>{L"next"});
    EXPECT_EQ(m_capture.Lines(),
              std::vector<std::string>{LogLine("Cannot copy text for client call of Print, dropped")});
    EXPECT_EQ(g_pCurrentServer, m_pServer);
}

TEST_F(Bridge, PromptThatCannotBeAllocatedIsLeftOutAndTheUserStillAsked)
{
    CAllocationSpy& spy = Spy();
    spy.FailNextBigAllocation();
    BSTR bstrAnswer = KxReplGetUserInput(BigText(L'?').c_str());
    EXPECT_STREQ(bstrAnswer, L"input");
    KxReplFreeString(bstrAnswer);
    auto vecCalls = m_pClient->CallsOf(CTestClient::DISPID_GETUSERINPUT);
    ASSERT_EQ(vecCalls.size(), 1u);
    ASSERT_EQ(vecCalls[0].args.size(), 1u);
    EXPECT_TRUE(vecCalls[0].args[0].bNullBstr);
    EXPECT_EQ(m_capture.Lines(),
              std::vector<std::string>{LogLine("Cannot copy prompt for client call of GetUserInput, asking without it")});
}

TEST_F(Bridge, ResultThatCannotBeAllocatedLeavesNullWithItsOwnLine)
{
    CAllocationSpy& spy = Spy();
    BSTR bstrResult = ::SysAllocString(L"old");
    spy.FailNextBigAllocation();
    KxReplSetResult(&bstrResult, BigText(L'r').c_str());
    EXPECT_EQ(bstrResult, nullptr);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Cannot copy command result, dropped")});
}

// ---- input -------------------------------------------------------------------------------

TEST_F(Bridge, InputAnswerArrivesWithTheExactCallLayout)
{
    CComVariant varAnswer;
    varAnswer.vt = VT_BSTR;
    varAnswer.bstrVal = ::SysAllocString(L"Ada");
    m_pClient->SetInputResult(varAnswer);
    BSTR bstrAnswer = KxReplGetUserInput(L"Name? ");
    EXPECT_STREQ(KxReplGetString(bstrAnswer), L"Ada");
    KxReplFreeString(bstrAnswer);
    auto vecCalls = m_pClient->CallsOf(CTestClient::DISPID_GETUSERINPUT);
    ASSERT_EQ(vecCalls.size(), 1u);
    const auto& call = vecCalls[0];
    EXPECT_TRUE(call.bRiidNull);
    EXPECT_EQ(call.lcid, static_cast<LCID>(0x0400));
    EXPECT_EQ(call.wFlags, DISPATCH_METHOD);
    EXPECT_EQ(call.cArgs, 1u);
    EXPECT_EQ(call.cNamedArgs, 0u);
    EXPECT_FALSE(call.bResultNull);
    EXPECT_EQ(call.vtResultOnEntry, VT_EMPTY);
    EXPECT_TRUE(call.bExcepInfoNull);
    EXPECT_TRUE(call.bArgErrNull);
    ASSERT_EQ(call.args.size(), 1u);
    EXPECT_EQ(call.args[0].vt, VT_BSTR);
    EXPECT_EQ(call.args[0].strText, L"Name? ");
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, NullPromptIsANullStringAndEmptyPromptAnEmptyOne)
{
    KxReplFreeString(KxReplGetUserInput(nullptr));
    KxReplFreeString(KxReplGetUserInput(L""));
    auto vecCalls = m_pClient->CallsOf(CTestClient::DISPID_GETUSERINPUT);
    ASSERT_EQ(vecCalls.size(), 2u);
    EXPECT_EQ(vecCalls[0].args[0].vt, VT_BSTR);
    EXPECT_TRUE(vecCalls[0].args[0].bNullBstr);
    EXPECT_EQ(vecCalls[1].args[0].vt, VT_BSTR);
    EXPECT_FALSE(vecCalls[1].args[0].bNullBstr);
    EXPECT_EQ(vecCalls[1].args[0].strText, L"");
}

TEST_F(Bridge, EmptyOrNonStringAnswerGivesNull)
{
    CComVariant varEmpty;
    m_pClient->SetInputResult(varEmpty);
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);
    CComVariant varNumber;
    varNumber.vt = VT_I4;
    varNumber.lVal = 42;
    m_pClient->SetInputResult(varNumber);
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, FailedInputCallGivesNullWithItsLine)
{
    m_pClient->SetResult(CTestClient::DISPID_GETUSERINPUT, E_FAIL);
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);
    EXPECT_EQ(g_pCurrentServer, m_pServer);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Client call of GetUserInput failed")});
}

TEST_F(Bridge, UnavailableClientDuringInputQuitsAndGivesNull)
{
    m_pClient->SetResult(CTestClient::DISPID_GETUSERINPUT, kClientUnavailable);
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);
    EXPECT_EQ(g_pCurrentServer, nullptr);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_DETACH), 1u);
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);  // no server now: silent
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Client is unavailable, quitting")});
}

TEST_F(Bridge, InputFromAnotherThreadIsRefusedWithItsLine)
{
    BSTR bstrAnswer = ::SysAllocString(L"unchanged");
    ASSERT_TRUE(RunOnOtherThread([&] { bstrAnswer = KxReplGetUserInput(L"> "); }));
    EXPECT_EQ(bstrAnswer, nullptr);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_GETUSERINPUT), 0u);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Can get user input from main thread only")});
}

TEST_F(Bridge, InputWithNoCurrentServerGivesNullSilently)
{
    g_pCurrentServer->Quit();
    EXPECT_EQ(KxReplGetUserInput(L"> "), nullptr);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_GETUSERINPUT), 0u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, InputDoesNotFlushQueuedOutputFirst)
{
    PrintOnOtherThread({L"queued"});
    KxReplFreeString(KxReplGetUserInput(L"> "));
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_PRINT), 0u);
    EXPECT_EQ(QueuedRecords(), 1u);
}

TEST_F(Bridge, InputAnswerIsHandedOverWithoutACopyAndFreedByTheCaller)
{
    CAllocationSpy& spy = Spy();
    long nBefore = spy.LiveBigBlocks();
    {
        CComVariant varAnswer;
        varAnswer.vt = VT_BSTR;
        varAnswer.bstrVal = ::SysAllocString(BigText(L'a').c_str());
        m_pClient->SetInputResult(varAnswer);  // the client's own copy stays alive
    }
    long nClientCopy = spy.LiveBigBlocks();
    BSTR bstrAnswer = KxReplGetUserInput(L"> ");
    ASSERT_NE(bstrAnswer, nullptr);
    EXPECT_EQ(std::wstring(KxReplGetString(bstrAnswer)), BigText(L'a'));
    EXPECT_EQ(spy.LiveBigBlocks(), nClientCopy + 1);  // the answer, and nothing else
    KxReplFreeString(bstrAnswer);
    EXPECT_EQ(spy.LiveBigBlocks(), nClientCopy);
    CComVariant varEmpty;
    m_pClient->SetInputResult(varEmpty);
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore);
}

// ---- quitting -------------------------------------------------------------------------------

TEST_F(Bridge, QuitOnTheMainThreadDetachesAndEndsTheRunOnce)
{
    KxReplQuit();
    EXPECT_EQ(g_pCurrentServer, nullptr);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_DETACH), 1u);
    KxReplQuit();  // nothing current: nothing happens
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_DETACH), 1u);
    EXPECT_TRUE(m_capture.Lines().empty());
}

TEST_F(Bridge, QuitFromAnotherThreadIsRefusedWithItsLine)
{
    ASSERT_TRUE(RunOnOtherThread([] { KxReplQuit(); }));
    EXPECT_EQ(g_pCurrentServer, m_pServer);
    EXPECT_EQ(m_pClient->CallCount(CTestClient::DISPID_DETACH), 0u);
    EXPECT_EQ(m_capture.Lines(), std::vector<std::string>{LogLine("Call Quit from main thread only")});
}

TEST_F(Bridge, QuitInsideACommandLetsItRunOnAndDropsItsLaterOutput)
{
    m_pServer->AddRef();  // the test's own hold across the Quit
    g_fnCommand = [](BSTR* pResult) {
        KxReplPrint(L"before", FALSE);
        KxReplQuit();
        KxReplPrint(L"after", FALSE);
        KxReplSetResult(pResult, L"ran to its end");
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    BSTR bstrResult = nullptr;
    EXPECT_EQ(m_pServer->Exec(bstrCommand, nullptr, &bstrResult), S_OK);
    EXPECT_STREQ(bstrResult, L"ran to its end");
    ::SysFreeString(bstrResult);
    EXPECT_EQ(PrintedTexts(), std::vector<std::wstring>{L"before"});
    EXPECT_EQ(g_pCurrentServer, nullptr);
    m_pServer->Release();
}

// ---- result and string helpers ----------------------------------------------------------------

TEST(ResultAndStrings, SetResultWithNullSlotMakesNoCopy)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CAllocationSpy& spy = Spy();
    long nBefore = spy.LiveBigBlocks();
    CDebugCapture capture;
    KxReplSetResult(nullptr, BigText(L'n').c_str());
    KxReplSetResult(nullptr, nullptr);
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore);
    EXPECT_TRUE(capture.Lines().empty());
    ::CoUninitialize();
}

TEST(ResultAndStrings, SetResultReplacesFreesAndClears)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CAllocationSpy& spy = Spy();
    long nBefore = spy.LiveBigBlocks();
    BSTR bstrResult = nullptr;
    KxReplSetResult(&bstrResult, BigText(L'1').c_str());
    KxReplSetResult(&bstrResult, BigText(L'2').c_str());
    EXPECT_EQ(std::wstring(bstrResult), BigText(L'2'));
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore + 1);  // the first one was freed
    KxReplSetResult(&bstrResult, nullptr);
    EXPECT_EQ(bstrResult, nullptr);
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore);
    KxReplSetResult(&bstrResult, L"");
    ASSERT_NE(bstrResult, nullptr);
    EXPECT_EQ(::SysStringLen(bstrResult), 0u);
    KxReplFreeString(bstrResult);
    ::CoUninitialize();
}

TEST(ResultAndStrings, GetStringIsTheStringItselfAndNullStaysNull)
{
    BSTR bstr = ::SysAllocString(L"text");
    EXPECT_EQ(KxReplGetString(bstr), bstr);
    EXPECT_STREQ(KxReplGetString(bstr), L"text");
    EXPECT_EQ(KxReplGetString(nullptr), nullptr);
    KxReplFreeString(bstr);
}

TEST(ResultAndStrings, FreeStringFreesAndIgnoresNull)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CAllocationSpy& spy = Spy();
    long nBefore = spy.LiveBigBlocks();
    BSTR bstr = ::SysAllocString(BigText(L'f').c_str());
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore + 1);
    KxReplFreeString(bstr);
    EXPECT_EQ(spy.LiveBigBlocks(), nBefore);
    KxReplFreeString(nullptr);
    ::CoUninitialize();
}
