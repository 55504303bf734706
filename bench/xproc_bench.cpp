// Cross-process benchmarks: what the server adds to the cost of a COM call
// between two processes, which it cannot avoid. Each figure is measured
// next to its floor in the same run:
//
//   exec       Exec("noop") round trip  vs  the same Invoke on a trivial
//              IDispatch served by another process (the "floor server",
//              this program started again with --floor-server)
//   output     4 threads x 10,000 lines printed in one command, lines/s at
//              the client  vs  one bare cross-process call per line
//   interrupt  "a" written to the pipe -> the client sees E_ABORT for a
//              spinning command  vs  one bare cross-process call
//   watchdog   client killed -> KxReplRun returns (5 s polls); the dying
//              client is this program started with --dying-client
//
// Usage: repl_xproc_bench [exec] [output] [interrupt] [watchdog]
// (no names: all of them). The host is repl_testhost.exe next to us.
#include <windows.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "BenchStats.h"
#include "client/ReplClient.h"

namespace {

constexpr DWORD kStartTimeoutMs = 20000;
constexpr DISPID kDispidFloorQuit = 99;
const char kFloorPrefix[] = "floor ";

// ---- the floor server -------------------------------------------------------

constexpr DISPID kDispidFloorPrint = 2;     // a call shaped like the client's Print
constexpr DISPID kDispidFloorCallBack = 3;  // (target, n): call target's Print n times
constexpr UINT WM_FLOOR_CALLBACK = WM_APP + 7;

// The least an automation object can do: every call succeeds at once. It
// counts the Print-shaped calls it receives and notes when the last came.
class CTrivialDispatch final : public IDispatch
{
public:
    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        if (ppv == nullptr) return E_POINTER;
        *ppv = nullptr;
        if (!::IsEqualIID(riid, IID_IUnknown) && !::IsEqualIID(riid, IID_IDispatch)) return E_NOINTERFACE;
        *ppv = static_cast<IDispatch*>(this);
        AddRef();
        return S_OK;
    }
    STDMETHOD_(ULONG, AddRef)() override { return static_cast<ULONG>(::InterlockedIncrement(&m_nRef)); }
    STDMETHOD_(ULONG, Release)() override
    {
        LONG nRef = ::InterlockedDecrement(&m_nRef);
        if (nRef == 0) delete this;
        return static_cast<ULONG>(nRef);
    }
    STDMETHOD(GetTypeInfoCount)(UINT* pctinfo) override
    {
        if (pctinfo) *pctinfo = 0;
        return S_OK;
    }
    STDMETHOD(GetTypeInfo)(UINT, LCID, ITypeInfo**) override { return E_NOTIMPL; }
    STDMETHOD(GetIDsOfNames)(REFIID, LPOLESTR*, UINT, LCID, DISPID*) override { return E_NOTIMPL; }
    STDMETHOD(Invoke)(DISPID dispid, REFIID, LCID, WORD, DISPPARAMS* pParams, VARIANT*, EXCEPINFO*, UINT*) override
    {
        if (dispid == kDispidFloorQuit) ::PostQuitMessage(0);
        if (dispid == kDispidFloorPrint) {
            m_dLastPrintUs = NowUs();
            ++m_nPrints;
        }
        if (dispid == kDispidFloorCallBack) return QueueCallBack(pParams);
        return S_OK;
    }

    long Prints() const noexcept { return m_nPrints.load(); }
    double LastPrintUs() const noexcept { return m_dLastPrintUs.load(); }

    // The call-back request taken from the message queue: the target and
    // how many calls to make.
    CComPtr<IDispatch> m_spTarget;
    long m_nCallBacks = 0;

private:
    // Answers at once and makes the calls from the message loop, the way the
    // server's main loop sends queued output after the command returned.
    HRESULT QueueCallBack(DISPPARAMS* pParams)
    {
        if (pParams == nullptr || pParams->cArgs != 2 || V_VT(&pParams->rgvarg[1]) != VT_DISPATCH ||
            V_VT(&pParams->rgvarg[0]) != VT_I4) {
            return DISP_E_BADPARAMCOUNT;
        }
        m_spTarget = V_DISPATCH(&pParams->rgvarg[1]);
        m_nCallBacks = V_I4(&pParams->rgvarg[0]);
        ::PostThreadMessageW(::GetCurrentThreadId(), WM_FLOOR_CALLBACK, 0, 0);
        return S_OK;
    }

    LONG m_nRef = 1;
    std::atomic<long> m_nPrints{0};
    std::atomic<double> m_dLastPrintUs{0};
};

VARIANT BoolArg(bool b)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BOOL;
    V_BOOL(&var) = b ? VARIANT_TRUE : VARIANT_FALSE;
    return var;
}

VARIANT BstrArg(BSTR bstr)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = bstr;
    return var;
}

// One call made the way the server calls its client's Print: a short line
// and a flag, no result, no exception information.
HRESULT FloorPrint(IDispatch* pTarget, int nLine)
{
    CComBSTR bstrLine((L"t0 " + std::to_wstring(nLine) + L"\n").c_str());
    VARIANT rgArgs[2] = {BoolArg(false), BstrArg(bstrLine)};  // the last parameter first
    DISPPARAMS params = {rgArgs, nullptr, 2, 0};
    return pTarget->Invoke(kDispidFloorPrint, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params, nullptr,
                           nullptr, nullptr);
}

void RunCallBacks(CTrivialDispatch& object)
{
    CComPtr<IDispatch> spTarget = std::move(object.m_spTarget);
    for (long i = 0; i < object.m_nCallBacks && spTarget; ++i) FloorPrint(spTarget, static_cast<int>(i));
}

// Serves one trivial object until told to quit or until the parent dies.
int FloorServerMain(DWORD dwParentPid)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CHandle hParent(::OpenProcess(SYNCHRONIZE, FALSE, dwParentPid));
    CTrivialDispatch* pObject = new CTrivialDispatch;
    CComPtr<IDispatch> spObject;
    spObject.Attach(pObject);
    std::string strText = MarshalToBase64(spObject);
    if (strText.empty() || !hParent) return 2;
    std::printf("%s%s\n", kFloorPrefix, strText.c_str());
    std::fflush(stdout);
    for (bool bQuit = false; !bQuit;) {
        HANDLE hWait = hParent.Get();
        DWORD dwWait = ::MsgWaitForMultipleObjects(1, &hWait, FALSE, INFINITE, QS_ALLINPUT);
        if (dwWait != WAIT_OBJECT_0 + 1) break;
        MSG msg;
        while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
            if (msg.message == WM_QUIT) bQuit = true;
            if (msg.message == WM_FLOOR_CALLBACK && msg.hwnd == nullptr) RunCallBacks(*pObject);
            ::DispatchMessageW(&msg);
        }
    }
    ::CoDisconnectObject(spObject, 0);
    return 0;
}

// The floor server, started and connected.
struct FloorServer
{
    CHostProcess process;
    CComPtr<IDispatch> spObject;

    bool Start()
    {
        HostOptions options;
        options.strCommandLine = QuoteArg(SelfPath()) + L" --floor-server " + std::to_wstring(::GetCurrentProcessId());
        options.bCaptureOutput = true;
        if (FAILED(process.Start(options))) return false;
        std::string strText;
        bool bGot = PumpUntil([&] { return TextFromOutput(process.Output(), strText); }, kStartTimeoutMs);
        return bGot && SUCCEEDED(UnmarshalFromBase64(strText, &spObject));
    }
    void Stop()
    {
        if (spObject) InvokeById(spObject, kDispidFloorQuit);
        spObject.Release();
        if (!process.WaitForExit(kStartTimeoutMs)) process.Kill();
    }

    static std::wstring SelfPath()
    {
        wchar_t szSelf[MAX_PATH];
        DWORD cch = ::GetModuleFileNameW(nullptr, szSelf, MAX_PATH);
        return std::wstring(szSelf, cch);
    }
    static bool TextFromOutput(const std::string& strOutput, std::string& strText)
    {
        size_t nStart = strOutput.find(kFloorPrefix);
        if (nStart == std::string::npos) return false;
        nStart += sizeof kFloorPrefix - 1;
        size_t nEnd = strOutput.find_first_of("\r\n", nStart);
        if (nEnd == std::string::npos) return false;
        strText = strOutput.substr(nStart, nEnd - nStart);
        return true;
    }
};

// ---- the server under test -------------------------------------------------------

std::wstring HostCommand()
{
    return QuoteArg(ProgramDirectory() + L"\\repl_testhost.exe");
}

// bCaptureHost: keep the host's own output off our console.
bool StartSession(CReplSession& session, bool bCaptureHost)
{
    SessionOptions options;
    options.strHostCommand = HostCommand();
    options.host.bCaptureOutput = bCaptureHost;
    return SUCCEEDED(session.Start(options)) && session.WaitConnected(kStartTimeoutMs);
}

// ---- exec: the round trip of a command that does nothing -------------------------

struct ExecFigures
{
    double dExecUs = 0;
    double dFloorUs = 0;
};

ExecFigures BenchExec(IDispatch* pServer, IDispatch* pFloor)
{
    constexpr int kRounds = 20, kCallsPerRound = 200, kWarmup = 200;
    for (int i = 0; i < kWarmup; ++i) {
        CallExec(pServer, L"noop", L"");
        CallExec(pFloor, L"noop", L"");
    }
    // Interleaved rounds, so that a slow spell of the machine hits both.
    std::vector<double> vecExec, vecFloor;
    for (int nRound = 0; nRound < kRounds; ++nRound) {
        for (int i = 0; i < kCallsPerRound; ++i) {
            double dStart = NowUs();
            HRESULT hr = CallExec(pServer, L"noop", L"").hr;
            vecExec.push_back(NowUs() - dStart);
            if (FAILED(hr)) std::printf("Exec failed: %ls\n", DescribeHResult(hr).c_str());
        }
        for (int i = 0; i < kCallsPerRound; ++i) {
            double dStart = NowUs();
            CallExec(pFloor, L"noop", L"");
            vecFloor.push_back(NowUs() - dStart);
        }
    }
    ExecFigures figures{Median(vecExec), Median(vecFloor)};
    PrintRow({"Exec(noop) round trip, median", figures.dExecUs, figures.dFloorUs, "us", "ratio <= 1.05",
              figures.dExecUs <= 1.05 * figures.dFloorUs});
    PrintNote("p90 Exec " + std::to_string(Quantile(vecExec, 0.9)) + " us, p90 floor " +
              std::to_string(Quantile(vecFloor, 0.9)) + " us, " + std::to_string(vecExec.size()) + " calls each");
    return figures;
}

// ---- output: many threads printing during one command -----------------------------

// True when every thread's lines arrived once each and in order.
bool CheckThreadOrder(const std::vector<CReplClientObject::Call>& vecCalls, int nThreads, int nLines)
{
    std::vector<int> vecNext(static_cast<size_t>(nThreads), 0);
    for (const auto& call : vecCalls) {
        int nThread = -1, nLine = -1;
        if (std::swscanf(call.strText.c_str(), L"t%d %d", &nThread, &nLine) != 2) return false;
        if (nThread < 0 || nThread >= nThreads || nLine != vecNext[static_cast<size_t>(nThread)]++) return false;
    }
    return vecNext == std::vector<int>(static_cast<size_t>(nThreads), nLines);
}

// Lines per second when the floor server calls a trivial object of ours once
// per line from its message loop while we pump: the server's direction.
double FloorLineRate(IDispatch* pFloor, long nCalls)
{
    CTrivialDispatch* pSink = new CTrivialDispatch;
    CComPtr<IDispatch> spSink;
    spSink.Attach(pSink);
    VARIANT varSink;
    ::VariantInit(&varSink);
    V_VT(&varSink) = VT_DISPATCH;
    V_DISPATCH(&varSink) = spSink;
    VARIANT varCount;
    ::VariantInit(&varCount);
    V_VT(&varCount) = VT_I4;
    V_I4(&varCount) = nCalls;
    double dStart = NowUs();
    InvokeById(pFloor, kDispidFloorCallBack, {varSink, varCount});
    bool bAll = PumpUntil([&] { return pSink->Prints() >= nCalls; }, 300000, 1);
    double dSeconds = (pSink->LastPrintUs() - dStart) / 1e6;
    ::CoDisconnectObject(spSink, 0);
    return bAll ? nCalls / dSeconds : 0.0;
}

void BenchOutput(CReplSession& session, IDispatch* pFloor)
{
    constexpr int kThreads = 4, kLines = 10000, kFloorCalls = 10000;
    CReplClientObject& client = session.Client();
    client.ClearCalls();
    std::atomic<double> dLastPrintUs{0};
    client.SetPrintHandler([&](const std::wstring&, bool) { dLastPrintUs = NowUs(); });
    // The floor before and after, for a machine whose speed drifts.
    double dFloorBefore = FloorLineRate(pFloor, kFloorCalls);
    size_t nBefore = client.CountOf(CReplClientObject::DISPID_PRINT);
    HANDLE hAll = client.PrintCountEvent(nBefore + kThreads * kLines);
    double dStart = NowUs();
    HRESULT hr = CallExec(session.Server(), L"print-threads", L"4 10000").hr;
    bool bAll = PumpWait(hAll, 300000);
    double dSeconds = (dLastPrintUs.load() - dStart) / 1e6;
    client.SetPrintHandler(nullptr);
    bool bOrdered = bAll && CheckThreadOrder(client.CallsOf(CReplClientObject::DISPID_PRINT), kThreads, kLines);

    double dRate = bAll ? kThreads * kLines / dSeconds : 0.0;
    double dFloorRate = (dFloorBefore + FloorLineRate(pFloor, kFloorCalls)) / 2;
    PrintRow({"output, 4 threads x 10,000 lines, one command", dRate, dFloorRate, "lines/s", "", bOrdered});
    PrintNote(std::string("Exec ") + (SUCCEEDED(hr) ? "succeeded" : "FAILED") + ", all lines " +
              (bAll ? "arrived" : "DID NOT ARRIVE") + ", each thread's order " + (bOrdered ? "kept" : "BROKEN") +
              ", " + std::to_string(dSeconds) + " s for 40,000 lines");
}

// ---- interrupt: from the pipe to the client's E_ABORT ------------------------------

void BenchInterrupt(CReplSession& session, double dFloorUs)
{
    constexpr int kTrials = 20;
    constexpr DWORD kCommandStartMs = 50;  // the spin has certainly begun by then
    std::vector<double> vecLatency;
    int nAborted = 0;
    for (int i = 0; i < kTrials; ++i) {
        std::atomic<double> dSentUs{0};
        std::thread sender([&] {
            ::Sleep(kCommandStartMs);
            dSentUs = NowUs();
            session.Pipe().Send(CInterruptPipe::kInterrupt);
        });
        CallResult spin = CallExec(session.Server(), L"spin", L"30000");
        double dDoneUs = NowUs();
        sender.join();
        if (spin.Effective() == E_ABORT) ++nAborted;
        vecLatency.push_back(dDoneUs - dSentUs.load());
    }
    double dMedian = Median(vecLatency);
    PrintRow({"interrupt: 'a' written -> E_ABORT, median", dMedian, dFloorUs, "us", "", true});
    PrintNote(std::to_string(nAborted) + " of " + std::to_string(kTrials) + " commands ended with E_ABORT; max " +
              std::to_string(Quantile(vecLatency, 1.0)) + " us");
}

// ---- watchdog: from the client's death to the end of the run ------------------------

// bBusy: the client dies while a command of its own runs.
int DyingClientMain(bool bBusy)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CReplSession session;
    // The host writes into our output, which the benchmark reads: it sees
    // the end of the run there after we are gone.
    if (!StartSession(session, false)) return 3;
    std::printf("host %lu\n", static_cast<unsigned long>(session.Host().ProcessId()));
    std::fflush(stdout);
    if (bBusy) CallExec(session.Server(), L"spin", L"120000");  // killed meanwhile
    PumpFor(120000);  // until killed
    return 0;
}

// Seconds from killing the client to the host's "KxReplRun returned";
// negative when the run did not end within the wait.
double OneWatchdogTrial(DWORD dwKillAfterMs, bool bBusy)
{
    HostOptions options;
    options.strCommandLine =
        QuoteArg(FloorServer::SelfPath()) + (bBusy ? L" --dying-client busy" : L" --dying-client idle");
    options.bCaptureOutput = true;  // the host inherits the client's output: we see its lines too
    CHostProcess client;
    if (FAILED(client.Start(options))) return -1;
    unsigned long nHostPid = 0;
    if (!PumpUntil([&] { return std::sscanf(client.Output().c_str(), "host %lu", &nHostPid) == 1; },
                   kStartTimeoutMs)) {
        client.Kill();
        return -1;
    }
    CHandle hHost(::OpenProcess(SYNCHRONIZE | PROCESS_TERMINATE, FALSE, nHostPid));
    PumpFor(dwKillAfterMs);
    client.Kill(9);
    double dKilledUs = NowUs();
    bool bEnded = PumpUntil([&] { return client.Output().find("KxReplRun returned") != std::string::npos; }, 20000, 1);
    double dSeconds = (NowUs() - dKilledUs) / 1e6;
    if (hHost && ::WaitForSingleObject(hHost.Get(), 5000) != WAIT_OBJECT_0) ::TerminateProcess(hHost.Get(), 1);
    return bEnded ? dSeconds : -1;
}

void BenchWatchdog()
{
    // The kill falls at different points of the five-second poll, with the
    // server idle and in the middle of a command.
    struct Trial
    {
        DWORD dwKillAfterMs;
        bool bBusy;
    };
    const Trial rgTrials[] = {{500, false}, {2500, false}, {4500, false}, {2500, true}};
    std::vector<double> vecSeconds;
    std::string strAll;
    bool bAllInRange = true;
    for (const Trial& trial : rgTrials) {
        double dSeconds = OneWatchdogTrial(trial.dwKillAfterMs, trial.bBusy);
        vecSeconds.push_back(dSeconds);
        // The watchdog polls every 5 s from the start of the run, which is
        // the connect give or take a few milliseconds.
        double dToNextPoll = (5000 - trial.dwKillAfterMs % 5000) / 1000.0;
        char szTrial[160];
        std::snprintf(szTrial, sizeof szTrial,
                      "%.3f s (%s, killed %lu ms after connect: next poll in %.1f s, %+.0f ms); ", dSeconds,
                      trial.bBusy ? "busy" : "idle", static_cast<unsigned long>(trial.dwKillAfterMs), dToNextPoll,
                      (dSeconds - dToNextPoll) * 1000);
        strAll += szTrial;
        bAllInRange = bAllInRange && dSeconds >= 0 && dSeconds <= 10.5;
    }
    PrintRow({"watchdog: client killed -> run ended, max", Quantile(vecSeconds, 1.0), 0, "s", "<= 10.5 s",
              bAllInRange});
    PrintNote(strAll);
}

bool Wanted(const std::set<std::string>& setNames, const char* pszName)
{
    return setNames.empty() || setNames.count(pszName) != 0;
}

int BenchMain(const std::set<std::string>& setNames)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    FloorServer floor;
    CReplSession session;
    if (!floor.Start() || !StartSession(session, true)) {
        std::fprintf(stderr, "cannot start the floor server or the host\n");
        return 2;
    }
    PrintHeader();
    ExecFigures exec;
    if (Wanted(setNames, "exec") || Wanted(setNames, "interrupt")) exec = BenchExec(session.Server(), floor.spObject);
    if (Wanted(setNames, "output")) BenchOutput(session, floor.spObject);
    if (Wanted(setNames, "interrupt")) BenchInterrupt(session, exec.dFloorUs);
    auto exitCode = session.Finish(kStartTimeoutMs);
    floor.Stop();
    if (!exitCode || *exitCode != 0) std::printf("the host did not end cleanly\n");
    if (Wanted(setNames, "watchdog")) BenchWatchdog();
    return 0;
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc >= 3 && std::string(argv[1]) == "--floor-server") {
        return FloorServerMain(static_cast<DWORD>(std::strtoul(argv[2], nullptr, 10)));
    }
    if (argc >= 3 && std::string(argv[1]) == "--dying-client") return DyingClientMain(std::string(argv[2]) == "busy");
    std::set<std::string> setNames(argv + 1, argv + argc);
    return BenchMain(setNames);
}
