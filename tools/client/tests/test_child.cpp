// A child process for the client library's tests. Each mode exercises one
// thing a host process does that the client side must cope with:
//
//   debug <threads> <lines> <exit>  debug lines "t<i> <j>\n" from several
//                                   threads at once, one wide line, then exit
//   veh                             raises an exception its own handler
//                                   continues; exit 0 only if the handler ran
//   output                          "out-text" to stdout, "err-text" to stderr,
//                                   then echoes its stdin as "stdin=<...>"
//   pipe <handle> <reads>           reads the inherited pipe, "read:<bytes>"
//                                   per read until EOF; exit = number of reads
//   tick <n> <ms>                   debug line "tick <i>\n" every ms; exit 7
//   fakeserver <text> <pid> <pipe>  a small stand-in server: attaches to the
//                                   client from the text and serves Exec,
//                                   ExecCom and Quit until Quit; Exec knows
//                                   echo, print, eprint, print-after (sent
//                                   once the command has returned), input,
//                                   spin <ms>, fail, log, quit
#include <windows.h>
#include <oaidl.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "client/Marshal.h"
#include "client/ServerCalls.h"
#include "common/Raii.h"

namespace {

constexpr DWORD kCustomException = 0xE0001234;
constexpr UINT kSendQueued = WM_APP + 7;
LONG g_nHandled = 0;

int DebugLines(int nThreads, int nLines, int nExit)
{
    std::vector<std::thread> vecThreads;
    for (int t = 0; t < nThreads; ++t) {
        vecThreads.emplace_back([t, nLines] {
            for (int j = 0; j < nLines; ++j) {
                std::string strLine = "t" + std::to_string(t) + " " + std::to_string(j) + "\n";
                ::OutputDebugStringA(strLine.c_str());
            }
        });
    }
    for (auto& thread : vecThreads) thread.join();
    ::OutputDebugStringW(L"wide line\n");
    return nExit;
}

LONG CALLBACK CustomHandler(EXCEPTION_POINTERS* pInfo)
{
    if (pInfo->ExceptionRecord->ExceptionCode != kCustomException) return EXCEPTION_CONTINUE_SEARCH;
    ::InterlockedIncrement(&g_nHandled);
    return EXCEPTION_CONTINUE_EXECUTION;
}

int RaiseHandled()
{
    ::AddVectoredExceptionHandler(1, CustomHandler);
    ::RaiseException(kCustomException, 0, 0, nullptr);
    ::OutputDebugStringA(g_nHandled == 1 ? "handled=1\n" : "handled=0\n");
    return g_nHandled == 1 ? 0 : 3;
}

int Output()
{
    std::fputs("out-text\n", stdout);
    std::fflush(stdout);
    std::fputs("err-text\n", stderr);
    std::fflush(stderr);
    std::string strIn;
    char szBuffer[256];
    size_t cb = 0;
    while ((cb = std::fread(szBuffer, 1, sizeof(szBuffer), stdin)) > 0) strIn.append(szBuffer, cb);
    std::printf("stdin=%s\n", strIn.c_str());
    return 0;
}

int ReadPipe(HANDLE hPipe, int nMaxReads)
{
    int nReads = 0;
    char szBuffer[256];
    DWORD cbRead = 0;
    while (nReads < nMaxReads && ::ReadFile(hPipe, szBuffer, sizeof(szBuffer), &cbRead, nullptr)) {
        ++nReads;
        std::printf("read:%s\n", std::string(szBuffer, cbRead).c_str());
        std::fflush(stdout);
    }
    return nReads;
}

int Tick(int n, DWORD dwMs)
{
    for (int i = 0; i < n; ++i) {
        ::OutputDebugStringA(("tick " + std::to_string(i) + "\n").c_str());
        ::Sleep(dwMs);
    }
    return 7;
}

// ---- the stand-in server ------------------------------------------------------------

std::wstring BstrText(BSTR bstr)
{
    return bstr ? std::wstring(bstr, ::SysStringLen(bstr)) : std::wstring();
}

VARIANT BstrArg(BSTR bstr)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = bstr;
    return var;
}

class CFakeServer final : public IDispatch
{
public:
    CFakeServer(IDispatch* pClient, HANDLE hPipe) : m_spClient(pClient), m_hPipe(hPipe) {}

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        if (riid != IID_IUnknown && riid != IID_IDispatch) {
            *ppv = nullptr;
            return E_NOINTERFACE;
        }
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
        *pctinfo = 0;
        return S_OK;
    }
    STDMETHOD(GetTypeInfo)(UINT, LCID, ITypeInfo**) override { return DISP_E_BADINDEX; }
    STDMETHOD(GetIDsOfNames)(REFIID, LPOLESTR* rgszNames, UINT cNames, LCID, DISPID* rgDispId) override
    {
        static const wchar_t* const kNames[] = {L"Exec", L"ExecCom", L"Quit"};
        for (UINT i = 0; i < cNames; ++i) rgDispId[i] = DISPID_UNKNOWN;
        for (DISPID id = 0; id < 3; ++id) {
            if (::_wcsicmp(rgszNames[0], kNames[id]) == 0) rgDispId[0] = id + 1;
        }
        return rgDispId[0] == DISPID_UNKNOWN || cNames > 1 ? DISP_E_UNKNOWNNAME : S_OK;
    }
    STDMETHOD(Invoke)(DISPID dispid, REFIID, LCID, WORD, DISPPARAMS* pParams, VARIANT* pVarResult,
                      EXCEPINFO* pExcepInfo, UINT*) override
    {
        if (dispid == 3) return Quit();
        if (dispid == 2) {
            if (pParams->cArgs != 2) return DISP_E_BADPARAMCOUNT;
            return ::VariantCopy(pVarResult, &pParams->rgvarg[0]);  // ExecCom echoes
        }
        if (dispid != 1) return DISP_E_MEMBERNOTFOUND;
        if (pParams->cArgs != 2 || V_VT(&pParams->rgvarg[1]) != VT_BSTR || V_VT(&pParams->rgvarg[0]) != VT_BSTR) {
            return DISP_E_TYPEMISMATCH;
        }
        try {
            std::wstring strResult, strFailure;
            HRESULT hr = Exec(BstrText(V_BSTR(&pParams->rgvarg[1])), BstrText(V_BSTR(&pParams->rgvarg[0])),
                              strResult, strFailure);
            if (FAILED(hr)) return Fail(pExcepInfo, hr, strFailure);
            V_VT(pVarResult) = VT_BSTR;
            V_BSTR(pVarResult) = ::SysAllocString(strResult.c_str());
            return S_OK;
        } catch (...) {
            return E_OUTOFMEMORY;
        }
    }

    // Output queued by a command and sent after it has returned, the way
    // a server sends what other threads printed.
    void SendQueued()
    {
        std::wstring strText;
        strText.swap(m_strQueued);
        if (!strText.empty()) Print(strText, false);
    }

    // Connect, as a server announces itself.
    HRESULT ConnectToClient()
    {
        VARIANT varSelf;
        V_VT(&varSelf) = VT_DISPATCH;
        V_DISPATCH(&varSelf) = this;
        return InvokeById(m_spClient, 1, {varSelf}).hr;
    }

private:
    ~CFakeServer() = default;

    // A failed method comes back the way a type-library Invoke reports it.
    static HRESULT Fail(EXCEPINFO* pExcepInfo, HRESULT hr, const std::wstring& strText)
    {
        if (pExcepInfo) {
            *pExcepInfo = EXCEPINFO();
            pExcepInfo->scode = hr;
            pExcepInfo->bstrDescription = strText.empty() ? nullptr : ::SysAllocString(strText.c_str());
        }
        return DISP_E_EXCEPTION;
    }

    HRESULT Print(const std::wstring& strText, bool bIsError)
    {
        CComBSTR bstrText(strText.c_str());
        VARIANT varError;
        V_VT(&varError) = VT_BOOL;
        V_BOOL(&varError) = bIsError ? VARIANT_TRUE : VARIANT_FALSE;
        return m_spClient ? InvokeById(m_spClient, 2, {BstrArg(bstrText), varError}).hr : E_FAIL;
    }

    HRESULT Input(const std::wstring& strPrompt, std::wstring& strResult, std::wstring& strFailure)
    {
        CComBSTR bstrPrompt(strPrompt.c_str());
        CallResult answer = InvokeById(m_spClient, 3, {BstrArg(bstrPrompt)});
        if (SUCCEEDED(answer.hr) && V_VT(&answer.varResult) == VT_BSTR) {
            strResult = answer.Text();
            return S_OK;
        }
        strFailure = L"EOFError";
        return DISP_E_EXCEPTION;
    }

    // Runs until 'a' arrives on the pipe or the time is up.
    HRESULT Spin(DWORD dwMs, std::wstring& strResult, std::wstring& strFailure)
    {
        ULONGLONG ullEnd = ::GetTickCount64() + dwMs;
        while (::GetTickCount64() < ullEnd) {
            DWORD cbAvail = 0;
            char ch = 0;
            DWORD cbRead = 0;
            if (::PeekNamedPipe(m_hPipe, nullptr, 0, nullptr, &cbAvail, nullptr) && cbAvail > 0 &&
                ::ReadFile(m_hPipe, &ch, 1, &cbRead, nullptr) && ch == 'a') {
                strFailure = L"KeyboardInterrupt";
                return E_ABORT;
            }
            ::Sleep(5);
        }
        strResult = L"done";
        return S_OK;
    }

    HRESULT Exec(const std::wstring& strCommand, const std::wstring& strArg, std::wstring& strResult,
                 std::wstring& strFailure)
    {
        if (strCommand == L"echo") strResult = strArg;
        else if (strCommand == L"print" || strCommand == L"eprint") return Print(strArg, strCommand == L"eprint");
        else if (strCommand == L"input") return Input(strArg, strResult, strFailure);
        else if (strCommand == L"print-after") {
            m_strQueued = strArg;
            ::PostThreadMessageW(::GetCurrentThreadId(), kSendQueued, 0, 0);
        }
        else if (strCommand == L"spin") return Spin(static_cast<DWORD>(std::wcstoul(strArg.c_str(), nullptr, 10)), strResult, strFailure);
        else if (strCommand == L"log") ::OutputDebugStringA((std::string(strArg.begin(), strArg.end()) + "\n").c_str());
        else if (strCommand == L"quit") {
            Quit();
            strResult = L"quit";
        } else {
            strFailure = strCommand == L"fail" ? strArg : L"unknown command: " + strCommand;
            return DISP_E_EXCEPTION;
        }
        return S_OK;
    }

    HRESULT Quit()
    {
        if (m_spClient) {
            InvokeById(m_spClient, 4, {});
            m_spClient.Release();
            ::PostQuitMessage(0);
        }
        return S_OK;
    }

    LONG m_nRef = 1;
    std::wstring m_strQueued;
    CComPtr<IDispatch> m_spClient;
    HANDLE m_hPipe;
};

void DrainMessages(DWORD dwMs)
{
    ULONGLONG ullEnd = ::GetTickCount64() + dwMs;
    MSG msg;
    while (::GetTickCount64() < ullEnd) {
        while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) ::DispatchMessageW(&msg);
        ::MsgWaitForMultipleObjects(0, nullptr, FALSE, 10, QS_ALLINPUT);
    }
}

int FakeServer(const char* pszText, HANDLE hPipe)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    int nResult = 0;
    {
        CComPtr<IDispatch> spClient;
        if (FAILED(UnmarshalFromBase64(pszText, &spClient))) {
            ::OutputDebugStringA("fakeserver: cannot attach\n");
            return 2;
        }
        ::OutputDebugStringA("fakeserver: attached\n");
        CFakeServer* pServer = new CFakeServer(spClient, hPipe);
        spClient.Release();
        if (FAILED(pServer->ConnectToClient())) nResult = 3;
        MSG msg;
        while (nResult == 0 && ::GetMessageW(&msg, nullptr, 0, 0) > 0) {
            if (msg.hwnd == nullptr && msg.message == kSendQueued) pServer->SendQueued();
            else ::DispatchMessageW(&msg);
        }
        pServer->Release();
    }
    ::OutputDebugStringA("fakeserver: done\n");
    DrainMessages(200);
    ::CoUninitialize();
    return nResult;
}

}  // namespace

int main(int argc, char** argv)
{
    std::string strMode = argc > 1 ? argv[1] : "";
    auto Arg = [argc, argv](int i) { return i < argc ? std::atoi(argv[i]) : 0; };
    auto HandleArg = [argc, argv](int i) {
        return reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(i < argc ? std::strtoull(argv[i], nullptr, 10) : 0));
    };
    if (strMode == "debug") return DebugLines(Arg(2), Arg(3), Arg(4));
    if (strMode == "veh") return RaiseHandled();
    if (strMode == "output") return Output();
    if (strMode == "pipe") return ReadPipe(HandleArg(2), Arg(3));
    if (strMode == "tick") return Tick(Arg(2), static_cast<DWORD>(Arg(3)));
    if (strMode == "fakeserver" && argc >= 5) return FakeServer(argv[2], HandleArg(4));
    std::fprintf(stderr, "usage: replclient_test_child <mode> ...\n");
    return 99;
}
