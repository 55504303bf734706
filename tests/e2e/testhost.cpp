// The test host: stands where python.exe stands in real use. It loads
// ReplServer.dll and the Python test doubles, hands its main thread to
// KxReplRun, and runs a small command language in its callbacks:
//
//   echo <text>        result <text>           noop             no result
//   print <text>       standard output         eprint <text>    error text
//   print-threads <threads> <lines>  threads print "t<i> <j>" lines at once
//   print-later <ms> <text>  a thread prints after the command has returned
//   input <prompt>     result: the answer; no answer fails with "EOFError"
//   spin [ms]          runs "Python code" until interrupted (fails with
//                      "KeyboardInterrupt") or ms pass (result "done")
//   spin-threads <n>   starts n Python threads that wait for an async
//                      KeyboardInterrupt and then print "thread <i> interrupted"
//   fail [text]        fails, with the text as failure text when given
//   quit               KxReplQuit from Python code
//   postquit           PostQuitMessage(0) from Python code
//   sleep <ms>         blocks without the interpreter lock
//   stats              result "live=<objects> gil=<owner> violations=<n>"
//   resources          result "handles=<n> private=<bytes> blocks=<n>
//                      live=<objects> violations=<n> threads=<n>": this
//                      process's open handles, committed private memory,
//                      live blocks of the task allocator (which holds every
//                      BSTR; -1 without --track-allocations), the double's
//                      live objects, its violations so far, and threads.
//                      First lets the double free the objects it keeps after
//                      their last reference went (to catch a late use),
//                      which would otherwise look like a leak; that resets
//                      the double's counters, so violations are summed here
//                      across readings.
//   print-then-flush <threads> <lines>  like print-threads, then the main
//                      thread prints "flushed", which sends the queued lines
//                      first, inside the command
//   print-storm <ms>   a thread prints "storm <i>" lines without pause for
//                      ms (also after the run has ended), then writes
//                      "storm printed <n> lines" to stdout; the host waits
//                      for it before exiting
//   ExecCom commands:  com-echo (result = argument), com-fail (failure
//                      object "com failure"), com-unconvertible, com-none
//
// Usage: repl_testhost <client-text> <client-pid> <pipe-handle> [options]
//   --runs <n>          call KxReplRun n times in a row
//   --next-text <text>  the client text of the next run (a marshalling
//                       packet can be unmarshalled once only)
//   --no-com            no COM-support module and no ExecCom callback
//   --dll <path>        the ReplServer.dll to load
//   --null <argument>   pass null/0 for pszClient, pid, python, pipe, exec
//   --invalid-pipe      pass 0xFFFFFFFF as the pipe handle
//   --track-allocations count the task allocator's live blocks, with the
//                       string cache off so that every BSTR is one of them
// Prints "KxReplRun returned <n>" per run; exits with the last result.
#include <windows.h>
#include <tlhelp32.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <mutex>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

#include "py_double_api.h"

namespace {

typedef int(__cdecl* ExecProcFn)(BSTR, BSTR, BSTR*);
typedef int(__cdecl* ExecComProcFn)(BSTR, PyObject*, PyObject**);
typedef int(__cdecl* KxReplRunFn)(const char*, DWORD, HMODULE, HMODULE, HANDLE, ExecProcFn, ExecComProcFn);
typedef void(__cdecl* KxReplPrintFn)(const wchar_t*, BOOL);
typedef BSTR(__cdecl* KxReplGetUserInputFn)(const wchar_t*);
typedef void(__cdecl* KxReplQuitFn)();
typedef void(__cdecl* KxReplSetResultFn)(BSTR*, const wchar_t*);
typedef wchar_t*(__cdecl* KxReplGetStringFn)(BSTR);
typedef void(__cdecl* KxReplFreeStringFn)(BSTR);

struct ServerApi
{
    KxReplRunFn Run;
    KxReplPrintFn Print;
    KxReplGetUserInputFn GetUserInput;
    KxReplQuitFn Quit;
    KxReplSetResultFn SetResult;
    KxReplGetStringFn GetString;
    KxReplFreeStringFn FreeString;
};
ServerApi g_api;

template <class T>
T Proc(HMODULE h, const char* pszName)
{
    T pfn = reinterpret_cast<T>(reinterpret_cast<void (*)()>(::GetProcAddress(h, pszName)));
    if (pfn == nullptr) {
        std::fprintf(stderr, "testhost: %s missing\n", pszName);
        std::exit(90);
    }
    return pfn;
}

std::wstring Text(BSTR bstr)
{
    return bstr ? std::wstring(bstr, ::SysStringLen(bstr)) : std::wstring();
}

// Splits "first rest..." at the first blank.
std::wstring FirstWord(const std::wstring& str, std::wstring* pstrRest)
{
    size_t nBlank = str.find(L' ');
    if (pstrRest) *pstrRest = nBlank == std::wstring::npos ? L"" : str.substr(nBlank + 1);
    return str.substr(0, nBlank);
}

int Succeed(BSTR* pResult, const std::wstring& strResult)
{
    g_api.SetResult(pResult, strResult.c_str());
    return 0;
}

int Fail(BSTR* pResult, const wchar_t* pszText)
{
    g_api.SetResult(pResult, pszText);
    return 1;
}

int PrintThreads(const std::wstring& strArg)
{
    std::wstring strLines;
    int nThreads = std::stoi(FirstWord(strArg, &strLines));
    int nLines = std::stoi(strLines);
    std::vector<std::thread> vecThreads;
    for (int t = 0; t < nThreads; ++t) {
        vecThreads.emplace_back([t, nLines] {
            for (int j = 0; j < nLines; ++j) {
                std::wstring strLine = L"t" + std::to_wstring(t) + L" " + std::to_wstring(j) + L"\n";
                g_api.Print(strLine.c_str(), FALSE);
            }
        });
    }
    for (auto& thread : vecThreads) thread.join();
    return 0;
}

int Spin(const std::wstring& strArg, BSTR* pResult)
{
    DWORD dwLimit = strArg.empty() ? 60000 : static_cast<DWORD>(std::stoul(strArg));
    ULONGLONG ullEnd = ::GetTickCount64() + dwLimit;
    int nState = PyGILState_Ensure();
    bool bInterrupted = false;
    while (!bInterrupted && ::GetTickCount64() < ullEnd) {
        bInterrupted = TestPy_CheckInterrupt() != 0;
    }
    PyGILState_Release(nState);
    return bInterrupted ? Fail(pResult, L"KeyboardInterrupt") : Succeed(pResult, L"done");
}

void SpinThreads(int nThreads)
{
    for (int i = 0; i < nThreads; ++i) {
        std::thread([i] {
            TestPy_RegisterThread();
            bool bGot = TestPy_WaitAsyncExc(60000) != 0;
            TestPy_UnregisterThread();
            std::wstring strLine = L"thread " + std::to_wstring(i) + (bGot ? L" interrupted\n" : L" timed out\n");
            g_api.Print(strLine.c_str(), FALSE);
        }).detach();
    }
}

int Stats(BSTR* pResult)
{
    std::wstring str = L"live=" + std::to_wstring(TestPy_LiveObjects()) + L" gil=" +
                       std::to_wstring(TestPy_GilOwner()) + L" violations=" +
                       std::to_wstring(TestPy_LockViolations() + TestPy_GilErrors() + TestPy_RefErrors());
    return Succeed(pResult, str);
}

// ---- resource counts for leak checks ------------------------------------------

// Counts the task allocator's live blocks. Registered only on request: it
// sees every allocation of the process while it is in place.
class CAllocationCounter final : public IMallocSpy
{
public:
    long LiveBlocks()
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return static_cast<long>(m_setLive.size());
    }

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
    STDMETHOD_(SIZE_T, PreAlloc)(SIZE_T cbRequest) override { return cbRequest; }
    STDMETHOD_(void*, PostAlloc)(void* pActual) override
    {
        if (pActual != nullptr) Track(pActual);
        return pActual;
    }
    STDMETHOD_(void*, PreFree)(void* pRequest, BOOL) override
    {
        Forget(pRequest);
        return pRequest;
    }
    STDMETHOD_(void, PostFree)(BOOL) override {}
    STDMETHOD_(SIZE_T, PreRealloc)(void* pRequest, SIZE_T cbRequest, void** ppNewRequest, BOOL) override
    {
        // The block is freed or may move: its old address goes either way.
        if (pRequest != nullptr) Forget(pRequest);
        *ppNewRequest = pRequest;
        return cbRequest;
    }
    STDMETHOD_(void*, PostRealloc)(void* pActual, BOOL) override
    {
        if (pActual != nullptr) Track(pActual);
        return pActual;
    }
    STDMETHOD_(void*, PreGetSize)(void* pRequest, BOOL) override { return pRequest; }
    STDMETHOD_(SIZE_T, PostGetSize)(SIZE_T cbActual, BOOL) override { return cbActual; }
    STDMETHOD_(void*, PreDidAlloc)(void* pRequest, BOOL) override { return pRequest; }
    STDMETHOD_(int, PostDidAlloc)(void*, BOOL, int fActual) override { return fActual; }
    STDMETHOD_(void, PreHeapMinimize)() override {}
    STDMETHOD_(void, PostHeapMinimize)() override {}

private:
    void Track(void* pv)
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_setLive.insert(pv);
    }
    void Forget(void* pv)
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_setLive.erase(pv);
    }

    std::mutex m_mutex;
    std::unordered_set<void*> m_setLive;
};

CAllocationCounter g_allocations;
bool g_bTrackAllocations = false;

// Turns the string cache off (freed strings would stay allocated in it) and
// starts counting. Call once, before the commands to be measured.
bool StartTrackingAllocations()
{
    typedef void(WINAPI * SetOaNoCacheFn)();
    auto pfnNoCache = reinterpret_cast<SetOaNoCacheFn>(
        reinterpret_cast<void (*)()>(::GetProcAddress(::GetModuleHandleA("oleaut32.dll"), "SetOaNoCache")));
    if (pfnNoCache == nullptr || FAILED(::CoRegisterMallocSpy(&g_allocations))) return false;
    pfnNoCache();
    g_bTrackAllocations = true;
    return true;
}

// Handle counts read 0 under Wine, so the open handles are found by asking
// about each handle value in turn; values are handed out densely from the
// bottom, so a long run of closed values means the end of the table.
long CountOpenHandles()
{
    constexpr ULONG_PTR kStep = 4, kEndAfterMisses = 4096;
    long nOpen = 0;
    ULONG_PTR nMisses = 0;
    for (ULONG_PTR nValue = kStep; nMisses < kEndAfterMisses; nValue += kStep) {
        DWORD dwFlags = 0;
        if (::GetHandleInformation(reinterpret_cast<HANDLE>(nValue), &dwFlags)) {
            ++nOpen;
            nMisses = 0;
        } else {
            ++nMisses;
        }
    }
    return nOpen;
}

// Committed private memory (heaps, stacks, allocations), summed over the
// address space, since the process counters read 0 under Wine.
unsigned long long CommittedPrivateBytes()
{
    unsigned long long cbTotal = 0;
    MEMORY_BASIC_INFORMATION info;
    const BYTE* pbAddress = nullptr;
    while (::VirtualQuery(pbAddress, &info, sizeof info) == sizeof info) {
        if (info.State == MEM_COMMIT && info.Type == MEM_PRIVATE) cbTotal += info.RegionSize;
        const BYTE* pbNext = static_cast<const BYTE*>(info.BaseAddress) + info.RegionSize;
        if (pbNext <= pbAddress) break;
        pbAddress = pbNext;
    }
    return cbTotal;
}

// This process's threads: a thread that the COM runtime adds commits its
// stack, which shows in the private memory.
long CountThreads()
{
    HANDLE hSnapshot = ::CreateToolhelp32Snapshot(TH32CS_SNAPTHREAD, 0);
    if (hSnapshot == INVALID_HANDLE_VALUE) return -1;
    long nThreads = 0;
    THREADENTRY32 entry{};
    entry.dwSize = sizeof entry;
    for (BOOL bMore = ::Thread32First(hSnapshot, &entry); bMore; bMore = ::Thread32Next(hSnapshot, &entry)) {
        if (entry.th32OwnerProcessID == ::GetCurrentProcessId()) ++nThreads;
    }
    ::CloseHandle(hSnapshot);
    return nThreads;
}

// The double's violations up to its last reset.
long g_nViolationsSeen = 0;

int Resources(BSTR* pResult)
{
    // Only this thread uses the double while a command runs.
    g_nViolationsSeen += TestPy_LockViolations() + TestPy_GilErrors() + TestPy_RefErrors();
    TestPy_Reset();
    long nBlocks = g_bTrackAllocations ? g_allocations.LiveBlocks() : -1;
    std::wstring str = L"handles=" + std::to_wstring(CountOpenHandles()) + L" private=" +
                       std::to_wstring(CommittedPrivateBytes()) + L" blocks=" + std::to_wstring(nBlocks) +
                       L" live=" + std::to_wstring(TestPy_LiveObjects()) + L" violations=" +
                       std::to_wstring(g_nViolationsSeen) + L" threads=" + std::to_wstring(CountThreads());
    return Succeed(pResult, str);
}

// ---- printing across the end of a run ---------------------------------------------

std::atomic<int> g_nStorms{0};

void StartStorm(DWORD dwMs)
{
    ++g_nStorms;
    std::thread([dwMs] {
        ULONGLONG ullEnd = ::GetTickCount64() + dwMs;
        long nLines = 0;
        while (::GetTickCount64() < ullEnd) {
            std::wstring strLine = L"storm " + std::to_wstring(nLines++) + L"\n";
            g_api.Print(strLine.c_str(), FALSE);
        }
        std::printf("storm printed %ld lines\n", nLines);
        std::fflush(stdout);
        --g_nStorms;
    }).detach();
}

// Lets every storm finish its report before the process ends.
void WaitForStorms()
{
    ULONGLONG ullEnd = ::GetTickCount64() + 30000;
    while (g_nStorms.load() > 0 && ::GetTickCount64() < ullEnd) ::Sleep(10);
}

int PrintThenFlush(const std::wstring& strArg)
{
    PrintThreads(strArg);
    g_api.Print(L"flushed", FALSE);
    return 0;
}

int __cdecl ExecProc(BSTR Command, BSTR Argument, BSTR* pResult)
{
    const std::wstring strCommand = Text(Command), strArg = Text(Argument);
    if (strCommand == L"echo") return Succeed(pResult, strArg);
    if (strCommand == L"noop") return 0;
    if (strCommand == L"print" || strCommand == L"eprint") {
        g_api.Print(Argument, strCommand == L"eprint");
        return 0;
    }
    if (strCommand == L"print-threads") return PrintThreads(strArg);
    if (strCommand == L"print-later") {
        std::wstring strText;
        DWORD dwMs = static_cast<DWORD>(std::stoul(FirstWord(strArg, &strText)));
        std::thread([dwMs, strText] {
            ::Sleep(dwMs);
            g_api.Print(strText.c_str(), FALSE);
        }).detach();
        return 0;
    }
    if (strCommand == L"input") {
        BSTR bstrAnswer = g_api.GetUserInput(Argument);
        if (bstrAnswer == nullptr) return Fail(pResult, L"EOFError");
        std::wstring strAnswer = g_api.GetString(bstrAnswer);
        g_api.FreeString(bstrAnswer);
        return Succeed(pResult, strAnswer);
    }
    if (strCommand == L"spin") return Spin(strArg, pResult);
    if (strCommand == L"spin-threads") {
        SpinThreads(std::stoi(strArg));
        return 0;
    }
    if (strCommand == L"fail") return Fail(pResult, Argument && *Argument ? Argument : nullptr);
    if (strCommand == L"quit") {
        g_api.Quit();
        return Succeed(pResult, L"quit");
    }
    if (strCommand == L"postquit") {
        ::PostQuitMessage(0);
        return 0;
    }
    if (strCommand == L"sleep") {
        ::Sleep(static_cast<DWORD>(std::stoul(strArg)));
        return 0;
    }
    if (strCommand == L"stats") return Stats(pResult);
    if (strCommand == L"resources") return Resources(pResult);
    if (strCommand == L"print-then-flush") return PrintThenFlush(strArg);
    if (strCommand == L"print-storm") {
        StartStorm(static_cast<DWORD>(std::stoul(strArg)));
        return 0;
    }
    return Fail(pResult, (L"unknown command: " + strCommand).c_str());
}

int __cdecl ExecProcGuarded(BSTR Command, BSTR Argument, BSTR* pResult)
{
    try {
        return ExecProc(Command, Argument, pResult);
    } catch (...) {
        return Fail(pResult, L"bad argument");
    }
}

int __cdecl ExecComProc(BSTR Command, PyObject* Argument, PyObject** pResult)
{
    const std::wstring strCommand = Text(Command);
    int nState = PyGILState_Ensure();
    int rc = 0;
    if (strCommand == L"com-echo") {
        TestPy_IncRef(Argument);
        *pResult = Argument;
    } else if (strCommand == L"com-fail") {
        *pResult = TestPy_NewStr(L"com failure");
        rc = 1;
    } else if (strCommand == L"com-unconvertible") {
        *pResult = TestPy_NewUnconvertible();
    } else if (strCommand != L"com-none") {
        *pResult = TestPy_NewStr((L"unknown command: " + strCommand).c_str());
        rc = 1;
    }
    PyGILState_Release(nState);
    return rc;
}

// Lets COM deliver the reply to the call that ended the run before the
// process goes away.
void DrainMessages(DWORD dwMs)
{
    ULONGLONG ullEnd = ::GetTickCount64() + dwMs;
    MSG msg;
    while (::GetTickCount64() < ullEnd) {
        while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
            if (msg.message == WM_QUIT) continue;
            ::TranslateMessage(&msg);
            ::DispatchMessageW(&msg);
        }
        ::MsgWaitForMultipleObjects(0, nullptr, FALSE, 10, QS_ALLINPUT);
    }
}

}  // namespace

int main(int argc, char** argv)
{
    if (argc < 4) {
        std::fprintf(stderr, "usage: repl_testhost <client-text> <client-pid> <pipe-handle> [options]\n");
        return 99;
    }
    const char* pszClient = argv[1];
    DWORD dwPid = static_cast<DWORD>(std::strtoul(argv[2], nullptr, 10));
    HANDLE hPipe = reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(std::strtoull(argv[3], nullptr, 10)));
    int nRuns = 1;
    std::vector<const char*> vecNextTexts;
    bool bCom = true, bNullPython = false, bNullExec = false, bTrackAllocations = false;
    const char* pszDll = "ReplServer.dll";
    for (int i = 4; i < argc; ++i) {
        std::string strOpt = argv[i];
        std::string strNext = i + 1 < argc ? argv[i + 1] : "";
        if (strOpt == "--runs") nRuns = std::atoi(argv[++i]);
        else if (strOpt == "--next-text") vecNextTexts.push_back(argv[++i]);
        else if (strOpt == "--no-com") bCom = false;
        else if (strOpt == "--dll") pszDll = argv[++i];
        else if (strOpt == "--track-allocations") bTrackAllocations = true;
        else if (strOpt == "--invalid-pipe") hPipe = reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(0xFFFFFFFFu));
        else if (strOpt == "--null") {
            ++i;
            if (strNext == "pszClient") pszClient = nullptr;
            else if (strNext == "pid") dwPid = 0;
            else if (strNext == "python") bNullPython = true;
            else if (strNext == "pipe") hPipe = nullptr;
            else if (strNext == "exec") bNullExec = true;
        }
    }

    HMODULE hServer = ::LoadLibraryA(pszDll);
    if (hServer == nullptr) {
        std::fprintf(stderr, "testhost: cannot load %s (%lu)\n", pszDll, ::GetLastError());
        return 98;
    }
    g_api = {Proc<KxReplRunFn>(hServer, "KxReplRun"),
             Proc<KxReplPrintFn>(hServer, "KxReplPrint"),
             Proc<KxReplGetUserInputFn>(hServer, "KxReplGetUserInput"),
             Proc<KxReplQuitFn>(hServer, "KxReplQuit"),
             Proc<KxReplSetResultFn>(hServer, "KxReplSetResult"),
             Proc<KxReplGetStringFn>(hServer, "KxReplGetString"),
             Proc<KxReplFreeStringFn>(hServer, "KxReplFreeString")};
    if (bTrackAllocations && !StartTrackingAllocations()) {
        std::fprintf(stderr, "testhost: cannot count allocations\n");
        return 97;
    }
    HMODULE hPython = bNullPython ? nullptr : ::GetModuleHandleA("PyRuntimeDouble.dll");
    // Nothing here calls into the COM-support double, so it is loaded by name.
    HMODULE hPythonCom = bCom ? ::LoadLibraryA("PyComDouble.dll") : nullptr;

    int nResult = -1;
    for (int nRun = 0; nRun < nRuns; ++nRun) {
        nResult = g_api.Run(pszClient, dwPid, hPython, hPythonCom, hPipe, bNullExec ? nullptr : ExecProcGuarded,
                            bCom ? ExecComProc : nullptr);
        std::printf("KxReplRun returned %d\n", nResult);
        std::fflush(stdout);
        if (static_cast<size_t>(nRun) < vecNextTexts.size()) pszClient = vecNextTexts[nRun];
    }
    DrainMessages(300);
    WaitForStorms();
    return nResult;
}
