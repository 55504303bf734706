// In-process benchmarks of the server's own code paths, each next to the
// floor it cannot go below:
//
//   names  GetIDsOfNames("Exec") answered from the name cache  vs  the type
//          information's own ITypeInfo::GetIDsOfNames
//   print  KxReplPrint on a thread other than the main thread while the main
//          thread idles  vs  the bare work it stands for (copy the text, one
//          short lock, one posted message); target median <= 2 us
#include <windows.h>
#include <oleauto.h>

#include <cstdio>
#include <deque>
#include <string>
#include <thread>
#include <vector>

#include "BenchStats.h"
#include "common/Raii.h"
#include "host/Bridge.h"
#include "host/KxRepl.h"
#include "host/RunState.h"
#include "server/ReplServerImpl.h"

namespace {

// ---- names: the name cache against the type information -----------------------

constexpr int kNameBatches = 200, kNamesPerBatch = 1000;

// Nanoseconds per call of fnLookup, one median over batches.
template <class Fn>
double NsPerCall(std::vector<double>& vecBatches, Fn fnLookup)
{
    double dStart = NowUs();
    for (int i = 0; i < kNamesPerBatch; ++i) fnLookup();
    vecBatches.push_back((NowUs() - dStart) * 1000.0 / kNamesPerBatch);
    return vecBatches.back();
}

bool BenchNames()
{
    CComObject<KxCIReplServerImpl>* pObject = nullptr;
    if (FAILED(CreateServerObject(&pObject)) || pObject == nullptr) return false;
    pObject->AddRef();
    IDispatch* pDispatch = static_cast<IReplServer*>(pObject);
    LPOLESTR rgszNames[] = {const_cast<LPOLESTR>(L"Exec")};
    DISPID dispid = 0;
    HRESULT hr = pDispatch->GetIDsOfNames(IID_NULL, rgszNames, 1, LOCALE_USER_DEFAULT, &dispid);  // fills the cache
    CComPtr<ITypeInfo> spInfo;
    if (SUCCEEDED(hr)) hr = pDispatch->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo);
    if (FAILED(hr) || dispid != 1) {
        pObject->Release();
        return false;
    }
    std::vector<double> vecCache, vecTypeInfo;
    DISPID dispidCache = 0, dispidTypeInfo = 0;
    for (int nBatch = 0; nBatch < kNameBatches; ++nBatch) {
        NsPerCall(vecCache,
                  [&] { pDispatch->GetIDsOfNames(IID_NULL, rgszNames, 1, LOCALE_USER_DEFAULT, &dispidCache); });
        NsPerCall(vecTypeInfo, [&] { spInfo->GetIDsOfNames(rgszNames, 1, &dispidTypeInfo); });
    }
    pObject->Release();
    double dCache = Median(vecCache), dTypeInfo = Median(vecTypeInfo);
    PrintRow({"GetIDsOfNames(\"Exec\") from the cache, median", dCache, dTypeInfo, "ns", "below the floor",
              dCache < dTypeInfo && dispidCache == 1 && dispidTypeInfo == 1});
    return true;
}

// ---- print: another thread's print while the main thread idles --------------------

constexpr int kPrintBatches = 50, kPrintsPerBatch = 1000;

// Batches of prints on a worker thread. After each batch the idle main
// thread empties the queue and its message queue, so that every batch
// starts from the same state (and a real system's limit on posted messages
// is never reached); the main thread touches nothing while a batch runs.
template <class PrintFn, class DrainFn>
std::vector<double> TimePrints(PrintFn fnPrint, DrainFn fnDrain)
{
    std::vector<std::wstring> vecLines;
    for (int i = 0; i < kPrintsPerBatch; ++i) vecLines.push_back(L"line " + std::to_wstring(i) + L"\n");
    CHandle hBatchDone(::CreateEventW(nullptr, FALSE, FALSE, nullptr));
    CHandle hDrained(::CreateEventW(nullptr, FALSE, FALSE, nullptr));
    std::vector<double> vecSamples;
    vecSamples.reserve(kPrintBatches * kPrintsPerBatch);
    std::thread worker([&] {
        for (int nBatch = 0; nBatch < kPrintBatches; ++nBatch) {
            for (const std::wstring& strLine : vecLines) {
                double dStart = NowUs();
                fnPrint(strLine.c_str());
                vecSamples.push_back(NowUs() - dStart);
            }
            ::SignalObjectAndWait(hBatchDone.Get(), hDrained.Get(), INFINITE, FALSE);
        }
    });
    for (int nBatch = 0; nBatch < kPrintBatches; ++nBatch) {
        ::WaitForSingleObject(hBatchDone.Get(), INFINITE);
        MSG msg;
        while (::PeekMessageW(&msg, nullptr, WM_PAINT, WM_PAINT, PM_REMOVE)) {
        }
        fnDrain();
        ::SetEvent(hDrained.Get());
    }
    worker.join();
    return vecSamples;
}

// The work a print of another thread stands for, done bare.
struct BareQueue
{
    std::deque<OutputRecord> queue;
    CCritSec cs;
    DWORD dwMainThreadId = ::GetCurrentThreadId();

    void Print(const wchar_t* pszText)
    {
        OutputRecord record{std::wstring(pszText), false};
        {
            CCritSecLock lock(cs);
            queue.push_back(std::move(record));
        }
        ::PostThreadMessageW(dwMainThreadId, WM_PAINT, 0, 0);
    }
    void Drain()
    {
        CCritSecLock lock(cs);
        queue.clear();
    }
};

bool BenchPrint()
{
    // This thread plays the run's main thread: it has a message queue and
    // the output queue is open, but no server is current, so a flush only
    // empties the queue.
    MSG msg;
    ::PeekMessageW(&msg, nullptr, 0, 0, PM_NOREMOVE);
    g_dwMainThreadId = ::GetCurrentThreadId();
    if (!OpenOutputQueue()) return false;
    auto vecPrint = TimePrints([](const wchar_t* psz) { KxReplPrint(psz, FALSE); }, [] { FlushQueuedOutput(); });
    CloseOutputQueue();
    BareQueue bare;
    auto vecFloor = TimePrints([&](const wchar_t* psz) { bare.Print(psz); }, [&] { bare.Drain(); });
    auto vecCopyLock = TimePrints(
        [&](const wchar_t* psz) {
            OutputRecord record{std::wstring(psz), false};
            CCritSecLock lock(bare.cs);
            bare.queue.push_back(std::move(record));
        },
        [&] { bare.Drain(); });
    auto vecPost = TimePrints([&](const wchar_t*) { ::PostThreadMessageW(bare.dwMainThreadId, WM_PAINT, 0, 0); },
                              [] {});
    std::vector<double> vecClock;
    for (int i = 0; i < 100000; ++i) {
        double dStart = NowUs();
        vecClock.push_back(NowUs() - dStart);
    }
    double dMedian = Median(vecPrint);
    PrintRow({"KxReplPrint, other thread, main idle, median", dMedian, Median(vecFloor), "us", "<= 2 us",
              dMedian <= 2.0});
    PrintNote("KxReplPrint p90 " + std::to_string(Quantile(vecPrint, 0.9)) + " us, p99 " +
              std::to_string(Quantile(vecPrint, 0.99)) + " us; of the floor: copy and lock " +
              std::to_string(Median(vecCopyLock)) + " us, PostThreadMessageW " + std::to_string(Median(vecPost)) +
              " us (medians); clock read " + std::to_string(Median(vecClock)) + " us");
    return true;
}

}  // namespace

int main()
{
    PrintHeader();
    bool bNames = BenchNames();
    bool bPrint = BenchPrint();
    if (!bNames || !bPrint) {
        std::printf("a benchmark could not be set up\n");
        return 2;
    }
    return 0;
}
