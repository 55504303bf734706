// The server object as a client drives it: connecting and quitting, Exec and
// ExecCom with their result codes, nested commands and interrupts. Commands
// go through IDispatch::Invoke as a late-bound client sends them, except
// where only a direct call can show a null pointer or an out-parameter.
#include <gtest/gtest.h>

#include <windows.h>
#include <oleauto.h>

#include <atomic>
#include <functional>
#include <memory>
#include <new>
#include <string>

#include "ReplServer_h.h"
#include "common/Raii.h"
#include "py_double_api.h"
#include "server/ExecState.h"
#include "server/Module.h"
#include "server/ReplServerImpl.h"
#include "support/DebugCapture.h"
#include "support/DispatchCall.h"
#include "support/TestClient.h"

namespace {

const DISPID kExec = 1;
const DISPID kExecCom = 2;
const DISPID kQuit = 3;
const HRESULT kRpcServerUnavailable = static_cast<HRESULT>(0x800706BE);
const DWORD kWaitMs = 10000;

HMODULE Runtime()
{
    return ::GetModuleHandleW(L"PyRuntimeDouble.dll");
}

HMODULE ComSupport()
{
    return ::GetModuleHandleW(L"PyComDouble.dll");
}

// ---- the command callbacks --------------------------------------------------------

typedef std::function<int(BSTR, BSTR, BSTR*)> ExecBehaviour;
typedef std::function<int(BSTR, PyObject*, PyObject**)> ExecComBehaviour;

// What the callbacks saw, for the assertions after the call.
struct CallbackRecord
{
    int nCalls = 0;
    std::wstring strCommand;
    std::wstring strArgument;
    bool bArgumentNull = false;
    bool bResultSlotEmpty = false;
    DWORD dwGilOwner = 0;       // the interpreter lock's owner while the callback ran
    int nDepth = 0;             // g_nExecDepth while the callback ran
    int nArgKind = PYDOUBLE_KIND_INVALID;
    long long nArgInt = 0;
    long nArgRefCount = -1;
};

ExecBehaviour g_fnExec;
ExecComBehaviour g_fnExecCom;
CallbackRecord g_execRecord;
CallbackRecord g_execComRecord;

std::wstring TextOf(BSTR bstr)
{
    return bstr == nullptr ? std::wstring() : std::wstring(bstr, ::SysStringLen(bstr));
}

int __cdecl TestExecProc(BSTR Command, BSTR Argument, BSTR* pResult)
{
    ++g_execRecord.nCalls;
    g_execRecord.strCommand = TextOf(Command);
    g_execRecord.strArgument = TextOf(Argument);
    g_execRecord.bArgumentNull = Argument == nullptr;
    g_execRecord.bResultSlotEmpty = *pResult == nullptr;
    g_execRecord.dwGilOwner = TestPy_GilOwner();
    g_execRecord.nDepth = g_nExecDepth;
    return g_fnExec ? g_fnExec(Command, Argument, pResult) : 0;
}

int __cdecl TestExecComProc(BSTR Command, PyObject* pArg, PyObject** ppResult)
{
    ++g_execComRecord.nCalls;
    g_execComRecord.strCommand = TextOf(Command);
    g_execComRecord.bResultSlotEmpty = *ppResult == nullptr;
    g_execComRecord.dwGilOwner = TestPy_GilOwner();
    g_execComRecord.nDepth = g_nExecDepth;
    {
        // Reading the object needs the lock, as in real Python code.
        int nState = PyGILState_Ensure();
        g_execComRecord.nArgKind = TestPy_Kind(pArg);
        g_execComRecord.nArgInt = TestPy_Int(pArg);
        g_execComRecord.nArgRefCount = TestPy_RefCount(pArg);
        PyGILState_Release(nState);
    }
    return g_fnExecCom ? g_fnExecCom(Command, pArg, ppResult) : 0;
}

// Stores a result text the way KxReplSetResult does.
void SetResultText(BSTR* pResult, const wchar_t* psz)
{
    ::SysFreeString(*pResult);
    *pResult = ::SysAllocString(psz);
}

// A new result object made with the lock held, as Python code would.
PyObject* NewObjectLocked(const std::function<PyObject*()>& fnMake)
{
    int nState = PyGILState_Ensure();
    PyObject* pObj = fnMake();
    PyGILState_Release(nState);
    return pObj;
}

// ---- interrupts from another thread --------------------------------------------------

// What the interrupt routine does with the execution state: under the
// interpreter lock, mark the interrupt (and raise it at depth 1).
struct InterruptRequest
{
    PFN_PyGILState_Ensure pfnEnsure;
    PFN_PyGILState_Release pfnRelease;
    PFN_PyErr_SetInterrupt pfnSetInterrupt;
    InterruptMark mark;
};

DWORD WINAPI InterruptThread(LPVOID pv)
{
    InterruptRequest* pRequest = static_cast<InterruptRequest*>(pv);
    CGilLock gil(pRequest->pfnEnsure, pRequest->pfnRelease);
    pRequest->mark = MarkInterrupt(pRequest->pfnSetInterrupt);
    return 0;
}

// Interrupts from another thread and waits for it; the mark's depth is -1
// when the thread did not finish in time.
InterruptMark InterruptFrom(HMODULE hRuntime)
{
    InterruptRequest request = {GetPythonProc<PFN_PyGILState_Ensure>(hRuntime, "PyGILState_Ensure"),
                                GetPythonProc<PFN_PyGILState_Release>(hRuntime, "PyGILState_Release"),
                                GetPythonProc<PFN_PyErr_SetInterrupt>(hRuntime, "PyErr_SetInterrupt"),
                                {-1, false}};
    CHandle hThread(::CreateThread(nullptr, 0, InterruptThread, &request, 0, nullptr));
    if (!hThread || ::WaitForSingleObject(hThread.Get(), kWaitMs) != WAIT_OBJECT_0) return {-1, false};
    return request.mark;
}

InterruptMark Interrupt()
{
    return InterruptFrom(Runtime());
}

// ---- the fixture ----------------------------------------------------------------------

// Takes every WM_QUIT out of this thread's queue and counts them.
int TakeQuitMessages()
{
    int nCount = 0;
    MSG msg;
    while (::PeekMessageW(&msg, nullptr, WM_QUIT, WM_QUIT, PM_REMOVE)) ++nCount;
    return nCount;
}

ULONG RefCountOf(IUnknown* pUnk)
{
    pUnk->AddRef();
    return pUnk->Release();
}

class ServerObjectTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        TestPy_Reset();
        TestPyCom_Reset();
        TakeQuitMessages();
        ::SetErrorInfo(0, nullptr);
        g_fnExec = nullptr;
        g_fnExecCom = nullptr;
        g_execRecord = CallbackRecord();
        g_execComRecord = CallbackRecord();
        m_nLiveObjects = TestPy_LiveObjects();
        m_nModuleLocks = ATL::_pAtlModule->GetModuleLockCount();
        m_pClient = CTestClient::Create();
        ASSERT_NE(nullptr, m_pClient);
    }

    void TearDown() override
    {
        if (m_pServer != nullptr && g_pCurrentServer == m_pServer) m_pServer->Quit();
        ReleaseServer();
        TakeQuitMessages();
        ULONG nClientRefs = m_pClient->Release();
        EXPECT_EQ(0u, nClientRefs) << "the server kept a client reference";
        EXPECT_EQ(nullptr, g_pCurrentServer);
        EXPECT_EQ(m_nModuleLocks, ATL::_pAtlModule->GetModuleLockCount());
        // The execution state is back at rest and the interpreter untouched.
        EXPECT_EQ(0, g_nExecDepth.load());
        EXPECT_FALSE(g_bInterrupted.load());
        EXPECT_FALSE(g_bInterruptPending.load());
        EXPECT_EQ(m_nLiveObjects, TestPy_LiveObjects());
        EXPECT_EQ(0, TestPy_RefErrors());
        EXPECT_EQ(0, TestPy_LockViolations());
        EXPECT_EQ(0, TestPy_GilErrors());
        EXPECT_EQ(0u, TestPy_GilOwner());
        EXPECT_EQ(TestPy_EnsureCalls(), TestPy_ReleaseCalls());
        g_fnExec = nullptr;
        g_fnExecCom = nullptr;
    }

    // What the main loop does: create, AddRef, Init, Release. The test keeps
    // the reference a connected client would hold.
    HRESULT StartRun(HMODULE hPython = Runtime(), HMODULE hPythonCom = ComSupport(),
                     ExecProc pExecProc = TestExecProc, ExecComProc pExecComProc = TestExecComProc,
                     IDispatch* pClient = nullptr)
    {
        CReplServerObject* pObject = nullptr;
        HRESULT hr = CreateServerObject(&pObject);
        if (FAILED(hr)) return hr;
        pObject->AddRef();
        hr = pObject->Init(pClient != nullptr ? pClient : m_pClient, hPython, hPythonCom, pExecProc, pExecComProc);
        pObject->AddRef();  // the client's
        m_pServer = pObject;
        pObject->Release();
        return hr;
    }

    void ReleaseServer()
    {
        if (m_pServer != nullptr) std::exchange(m_pServer, nullptr)->Release();
    }

    IDispatch* Dispatch() const { return static_cast<IReplServer*>(m_pServer); }

    void InvokeExec(const wchar_t* pszCommand, const wchar_t* pszArgument, DispatchOutcome& outcome)
    {
        DispatchArg command = DispatchArg::Bstr(pszCommand);
        DispatchArg argument = DispatchArg::Bstr(pszArgument);
        InvokeMethod(Dispatch(), kExec, {&command, &argument}, outcome);
    }

    void InvokeExecCom(const wchar_t* pszCommand, const DispatchArg& argument, DispatchOutcome& outcome)
    {
        DispatchArg command = DispatchArg::Bstr(pszCommand);
        InvokeMethod(Dispatch(), kExecCom, {&command, &argument}, outcome);
    }

    CTestClient* m_pClient = nullptr;
    CReplServerObject* m_pServer = nullptr;
    long m_nLiveObjects = 0;
    LONG m_nModuleLocks = 0;
};

}  // namespace

// ---- connecting -------------------------------------------------------------------------

TEST_F(ServerObjectTest, InitRefusesANullClientOrCallbackAndStoresNothing)
{
    CDebugCapture capture;
    ULONG nClientRefs = m_pClient->RefCount();
    CReplServerObject* pObject = nullptr;
    ASSERT_EQ(S_OK, CreateServerObject(&pObject));
    pObject->AddRef();
    EXPECT_EQ(E_INVALIDARG, pObject->Init(nullptr, Runtime(), ComSupport(), TestExecProc, TestExecComProc));
    EXPECT_EQ(E_INVALIDARG, pObject->Init(m_pClient, Runtime(), ComSupport(), nullptr, TestExecComProc));
    EXPECT_EQ(nullptr, pObject->m_spClient.Get());
    EXPECT_EQ(nullptr, pObject->m_pExecProc);
    EXPECT_FALSE(pObject->m_python.IsBound());
    EXPECT_EQ(nClientRefs, m_pClient->RefCount());
    EXPECT_EQ(0u, m_pClient->Calls().size());
    EXPECT_EQ(nullptr, g_pCurrentServer);
    EXPECT_EQ(0u, pObject->Release());
    EXPECT_TRUE(capture.Lines().empty());
}

TEST_F(ServerObjectTest, InitConnectsTheClientAndBecomesCurrent)
{
    CDebugCapture capture;
    ASSERT_EQ(S_OK, StartRun());
    EXPECT_EQ(m_pServer, g_pCurrentServer);
    auto calls = m_pClient->Calls();
    ASSERT_EQ(1u, calls.size());
    const CTestClient::Call& connect = calls[0];
    EXPECT_EQ(CTestClient::DISPID_CONNECT, connect.dispid);
    EXPECT_TRUE(connect.bRiidNull);
    EXPECT_EQ(static_cast<LCID>(0x0400), connect.lcid);
    EXPECT_EQ(DISPATCH_METHOD, connect.wFlags);
    EXPECT_EQ(1u, connect.cArgs);
    EXPECT_EQ(0u, connect.cNamedArgs);
    EXPECT_TRUE(connect.bNamedArgsNull);
    EXPECT_TRUE(connect.bResultNull);
    EXPECT_TRUE(connect.bExcepInfoNull);
    EXPECT_TRUE(connect.bArgErrNull);
    EXPECT_EQ(::GetCurrentThreadId(), connect.dwThreadId);
    ASSERT_EQ(1u, connect.args.size());
    EXPECT_EQ(VT_DISPATCH, connect.args[0].vt);
    EXPECT_EQ(Dispatch(), connect.args[0].pDispatch);
    // The run's own reference and the test's; the argument's was given back.
    EXPECT_EQ(2u, RefCountOf(Dispatch()));
    EXPECT_EQ(2u, m_pClient->RefCount());
    EXPECT_TRUE(m_pServer->m_python.IsBound());
    EXPECT_TRUE(capture.Lines().empty());
}

TEST_F(ServerObjectTest, RefusedConnectLeavesNoRunReference)
{
    CDebugCapture capture;
    m_pClient->SetResult(CTestClient::DISPID_CONNECT, kRpcServerUnavailable);
    EXPECT_EQ(kRpcServerUnavailable, StartRun());
    EXPECT_EQ(nullptr, g_pCurrentServer);
    EXPECT_EQ(1u, RefCountOf(Dispatch()));  // the test's only
    EXPECT_EQ(std::vector<std::string>{LogLine("Client call of Connect failed")}, capture.Lines());
    ReleaseServer();
    EXPECT_EQ(m_nModuleLocks, ATL::_pAtlModule->GetModuleLockCount());
}

TEST_F(ServerObjectTest, WithoutTheComCallbackExecComIsNotImplemented)
{
    ASSERT_EQ(S_OK, StartRun(Runtime(), ComSupport(), TestExecProc, nullptr));
    DispatchOutcome com;
    InvokeExecCom(L"cmd", DispatchArg::I4(1), com);
    EXPECT_EQ(DISP_E_EXCEPTION, com.hr);
    EXPECT_EQ(E_NOTIMPL, com.excepInfo.scode);
    DispatchOutcome text;
    InvokeExec(L"cmd", L"arg", text);
    EXPECT_EQ(S_OK, text.hr);
    EXPECT_EQ(0, g_execComRecord.nCalls);
}

TEST_F(ServerObjectTest, WithoutTheComModuleExecComIsNotImplemented)
{
    ASSERT_EQ(S_OK, StartRun(Runtime(), nullptr));
    EXPECT_FALSE(m_pServer->m_python.IsBound());
    CComVariant varResult;
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    ::VariantInit(&varArg);
    EXPECT_EQ(E_NOTIMPL, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    DispatchOutcome text;
    InvokeExec(L"cmd", L"arg", text);
    EXPECT_EQ(S_OK, text.hr);
    EXPECT_EQ(0, g_execComRecord.nCalls);
    EXPECT_EQ(1, g_execRecord.nCalls);
}

// ---- quitting ------------------------------------------------------------------------------

TEST_F(ServerObjectTest, QuitDetachesReleasesTheClientAndEndsTheRun)
{
    CDebugCapture capture;
    ASSERT_EQ(S_OK, StartRun());
    m_pClient->ClearCalls();
    DispatchOutcome outcome;
    InvokeMethod(Dispatch(), kQuit, {}, outcome);
    EXPECT_EQ(S_OK, outcome.hr);
    auto calls = m_pClient->Calls();
    ASSERT_EQ(1u, calls.size());
    EXPECT_EQ(CTestClient::DISPID_DETACH, calls[0].dispid);
    EXPECT_EQ(0u, calls[0].cArgs);
    EXPECT_TRUE(calls[0].bRgvargNull);
    EXPECT_TRUE(calls[0].bNamedArgsNull);
    EXPECT_TRUE(calls[0].bResultNull);
    EXPECT_TRUE(calls[0].bExcepInfoNull);
    EXPECT_TRUE(calls[0].bRiidNull);
    EXPECT_EQ(DISPATCH_METHOD, calls[0].wFlags);
    EXPECT_EQ(1u, m_pClient->RefCount());
    EXPECT_EQ(nullptr, g_pCurrentServer);
    EXPECT_EQ(1u, RefCountOf(Dispatch()));  // only the test's is left
    EXPECT_EQ(nullptr, m_pServer->m_pExecProc);
    EXPECT_EQ(nullptr, m_pServer->m_pExecComProc);
    EXPECT_EQ(1, TakeQuitMessages());
    EXPECT_TRUE(capture.Lines().empty());
}

TEST_F(ServerObjectTest, RepeatedQuitDetachesAndReleasesOnlyOnce)
{
    ASSERT_EQ(S_OK, StartRun());
    for (int i = 0; i < 3; ++i) {
        DispatchOutcome outcome;
        InvokeMethod(Dispatch(), kQuit, {}, outcome);
        EXPECT_EQ(S_OK, outcome.hr);
    }
    EXPECT_EQ(1u, m_pClient->CallCount(CTestClient::DISPID_DETACH));
    EXPECT_EQ(1u, RefCountOf(Dispatch()));
    EXPECT_EQ(1, TakeQuitMessages());
}

TEST_F(ServerObjectTest, FailedDetachIsLoggedAndTheQuitCompletes)
{
    ASSERT_EQ(S_OK, StartRun());
    m_pClient->SetResult(CTestClient::DISPID_DETACH, E_FAIL);
    CDebugCapture capture;
    EXPECT_EQ(S_OK, m_pServer->Quit());
    EXPECT_EQ(std::vector<std::string>{LogLine("Client call of Detach failed")}, capture.Lines());
    EXPECT_EQ(nullptr, g_pCurrentServer);
    EXPECT_EQ(1u, m_pClient->RefCount());
    EXPECT_EQ(1u, RefCountOf(Dispatch()));
    EXPECT_EQ(1, TakeQuitMessages());
}

TEST_F(ServerObjectTest, QuitFromInsideDetachDetachesOnce)
{
    ASSERT_EQ(S_OK, StartRun());
    HRESULT hrInner = E_UNEXPECTED;
    m_pClient->SetHook(CTestClient::DISPID_DETACH, [&](const CTestClient::Call&) {
        DispatchOutcome outcome;
        InvokeMethod(Dispatch(), kQuit, {}, outcome);
        hrInner = outcome.hr;
        return S_FALSE;
    });
    EXPECT_EQ(S_OK, m_pServer->Quit());
    EXPECT_EQ(S_OK, hrInner);
    EXPECT_EQ(1u, m_pClient->CallCount(CTestClient::DISPID_DETACH));
    EXPECT_EQ(1u, RefCountOf(Dispatch()));
    EXPECT_EQ(1, TakeQuitMessages());
}

TEST_F(ServerObjectTest, LateCommandsAfterQuitAreRefused)
{
    ASSERT_EQ(S_OK, StartRun());
    ASSERT_EQ(S_OK, m_pServer->Quit());
    DispatchOutcome text;
    InvokeExec(L"cmd", L"arg", text);
    EXPECT_EQ(DISP_E_EXCEPTION, text.hr);
    EXPECT_EQ(E_FAIL, text.excepInfo.scode);
    DispatchOutcome com;
    InvokeExecCom(L"cmd", DispatchArg::I4(1), com);
    EXPECT_EQ(DISP_E_EXCEPTION, com.hr);
    EXPECT_EQ(E_NOTIMPL, com.excepInfo.scode);
    EXPECT_EQ(0, g_execRecord.nCalls);
    EXPECT_EQ(0, g_execComRecord.nCalls);
}

TEST_F(ServerObjectTest, TheClientsLastReleaseDestroysTheQuitObject)
{
    ASSERT_EQ(S_OK, StartRun());
    ASSERT_EQ(S_OK, m_pServer->Quit());
    EXPECT_EQ(m_nModuleLocks + 1, ATL::_pAtlModule->GetModuleLockCount());
    ReleaseServer();
    EXPECT_EQ(m_nModuleLocks, ATL::_pAtlModule->GetModuleLockCount());
}

TEST_F(ServerObjectTest, QuitOfAnOldObjectLeavesALaterRunAlone)
{
    ASSERT_EQ(S_OK, StartRun());
    CReplServerObject* pOld = m_pServer;
    pOld->AddRef();
    ASSERT_EQ(S_OK, pOld->Quit());
    TakeQuitMessages();
    ReleaseServer();

    CTestClient* pSecondClient = CTestClient::Create();
    ASSERT_NE(nullptr, pSecondClient);
    ASSERT_EQ(S_OK, StartRun(Runtime(), ComSupport(), TestExecProc, TestExecComProc, pSecondClient));
    EXPECT_EQ(S_OK, pOld->Quit());  // the old object's client quits it again
    EXPECT_EQ(m_pServer, g_pCurrentServer);
    EXPECT_EQ(0, TakeQuitMessages());
    pOld->Release();  // destroyed now
    EXPECT_EQ(m_pServer, g_pCurrentServer);
    EXPECT_EQ(S_OK, m_pServer->Quit());
    EXPECT_EQ(1, TakeQuitMessages());
    EXPECT_EQ(1u, pSecondClient->CallCount(CTestClient::DISPID_DETACH));
    EXPECT_EQ(1u, m_pClient->CallCount(CTestClient::DISPID_DETACH));
    pSecondClient->Release();
}

// ---- Exec ------------------------------------------------------------------------------------

TEST_F(ServerObjectTest, ExecByNamePassesCommandAndArgumentAndReturnsTheResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR* pResult) {
        SetResultText(pResult, L"result");
        return 0;
    };
    LPOLESTR rgszName[] = {const_cast<LPOLESTR>(L"Exec")};
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, Dispatch()->GetIDsOfNames(IID_NULL, rgszName, 1, LOCALE_USER_DEFAULT, &dispid));
    DispatchArg command = DispatchArg::Bstr(L"print(1)");
    DispatchArg argument = DispatchArg::Bstr(L"the argument");
    DispatchOutcome outcome;
    InvokeMethod(Dispatch(), dispid, {&command, &argument}, outcome);
    EXPECT_EQ(S_OK, outcome.hr);
    EXPECT_EQ(VT_BSTR, V_VT(&outcome.varResult));
    EXPECT_EQ(L"result", outcome.ResultText());
    EXPECT_EQ(1, g_execRecord.nCalls);
    EXPECT_EQ(L"print(1)", g_execRecord.strCommand);
    EXPECT_EQ(L"the argument", g_execRecord.strArgument);
    EXPECT_TRUE(g_execRecord.bResultSlotEmpty);
    EXPECT_EQ(1, g_execRecord.nDepth);
}

TEST_F(ServerObjectTest, ExecPassesANullArgumentOnAsNull)
{
    ASSERT_EQ(S_OK, StartRun());
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(S_OK, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    EXPECT_TRUE(g_execRecord.bArgumentNull);
    EXPECT_EQ(nullptr, bstrResult.Get());
}

TEST_F(ServerObjectTest, ExecRefusesNullPointersBeforeTheCallback)
{
    ASSERT_EQ(S_OK, StartRun());
    CComBSTR bstrCommand(L"cmd");
    EXPECT_EQ(E_POINTER, m_pServer->Exec(bstrCommand, nullptr, nullptr));
    BSTR bstrResult = reinterpret_cast<BSTR>(static_cast<uintptr_t>(0x1234));
    EXPECT_EQ(E_INVALIDARG, m_pServer->Exec(nullptr, nullptr, &bstrResult));
    EXPECT_EQ(nullptr, bstrResult);
    EXPECT_EQ(0, g_execRecord.nCalls);
}

TEST_F(ServerObjectTest, FailingCommandTextArrivesInExcepInfo)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR* pResult) {
        SetResultText(pResult, L"NameError: x");
        return 1;
    };
    DispatchOutcome outcome;
    InvokeExec(L"x", nullptr, outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.excepInfo.scode);
    EXPECT_EQ(L"NameError: x", outcome.Description());
}

TEST_F(ServerObjectTest, FailingCommandKeepsItsTextAndSetsTheErrorObject)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR* pResult) {
        SetResultText(pResult, L"failure text");
        return -1;
    };
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(DISP_E_EXCEPTION, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    EXPECT_STREQ(L"failure text", bstrResult.Get());
    CComPtr<IErrorInfo> spInfo;
    ASSERT_EQ(S_OK, ::GetErrorInfo(0, &spInfo));
    CComBSTR bstrDescription;
    spInfo->GetDescription(&bstrDescription);
    EXPECT_STREQ(L"failure text", bstrDescription.Get());
    GUID guid = GUID_NULL;
    spInfo->GetGUID(&guid);
    EXPECT_TRUE(::IsEqualGUID(guid, IID_IReplServer));
}

TEST_F(ServerObjectTest, FailingCommandWithoutTextLeavesNoErrorObject)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR*) { return 1; };
    // A stale error object of some earlier call must not be reported with it.
    ReportErrorInfo(CLSID_ReplServer, L"stale", IID_IReplServer, DISP_E_EXCEPTION);
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(DISP_E_EXCEPTION, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    CComPtr<IErrorInfo> spInfo;
    EXPECT_EQ(S_FALSE, ::GetErrorInfo(0, &spInfo));

    ReportErrorInfo(CLSID_ReplServer, L"stale", IID_IReplServer, DISP_E_EXCEPTION);
    DispatchOutcome outcome;
    InvokeExec(L"cmd", nullptr, outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.excepInfo.scode);
    EXPECT_FALSE(outcome.HasDescription());
}

TEST_F(ServerObjectTest, FailedPrintBecomesTheCommandsResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR* pResult) {
        g_pCurrentServer->m_hrLastPrintError = kRpcServerUnavailable;  // as the bridge records it
        SetResultText(pResult, L"output");
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(kRpcServerUnavailable, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    EXPECT_STREQ(L"output", bstrResult.Get());
    DispatchOutcome outcome;
    InvokeExec(L"cmd", nullptr, outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(kRpcServerUnavailable, outcome.excepInfo.scode);
    // The next command starts clean.
    g_fnExec = nullptr;
    DispatchOutcome next;
    InvokeExec(L"cmd", nullptr, next);
    EXPECT_EQ(S_OK, next.hr);
}

TEST_F(ServerObjectTest, CommandFailureOutranksAFailedPrint)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR*) {
        g_pCurrentServer->m_hrLastPrintError = E_FAIL;
        return 1;
    };
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(DISP_E_EXCEPTION, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
}

TEST_F(ServerObjectTest, PositivePrintResultIsNoFailure)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR*) {
        g_pCurrentServer->m_hrLastPrintError = S_FALSE;
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(S_OK, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
}

TEST_F(ServerObjectTest, NestedCommandResetsTheOuterPrintFailure)
{
    ASSERT_EQ(S_OK, StartRun());
    HRESULT hrNested = E_UNEXPECTED;
    g_fnExec = [&](BSTR Command, BSTR, BSTR*) {
        if (TextOf(Command) != L"outer") return 0;
        g_pCurrentServer->m_hrLastPrintError = E_FAIL;  // before the nested command
        DispatchOutcome nested;
        InvokeExec(L"inner", nullptr, nested);
        hrNested = nested.hr;
        return 0;
    };
    DispatchOutcome outcome;
    InvokeExec(L"outer", nullptr, outcome);
    EXPECT_EQ(S_OK, hrNested);
    EXPECT_EQ(S_OK, outcome.hr);
    EXPECT_EQ(2, g_execRecord.nCalls);
}

TEST_F(ServerObjectTest, PrintFailureOfANestedCommandCountsForTheOuterOneToo)
{
    ASSERT_EQ(S_OK, StartRun());
    HRESULT hrNested = E_UNEXPECTED;
    g_fnExec = [&](BSTR Command, BSTR, BSTR*) {
        if (TextOf(Command) == L"inner") {
            g_pCurrentServer->m_hrLastPrintError = E_FAIL;
            return 0;
        }
        DispatchOutcome nested;
        InvokeExec(L"inner", nullptr, nested);
        hrNested = nested.excepInfo.scode;
        return 0;
    };
    DispatchOutcome outcome;
    InvokeExec(L"outer", nullptr, outcome);
    EXPECT_EQ(E_FAIL, hrNested);
    EXPECT_EQ(E_FAIL, outcome.excepInfo.scode);
}

TEST_F(ServerObjectTest, ExceptionFromACallbackBecomesItsResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExec = [](BSTR, BSTR, BSTR*) -> int { throw std::bad_alloc(); };
    CComBSTR bstrCommand(L"cmd");
    CComBSTR bstrResult;
    EXPECT_EQ(E_OUTOFMEMORY, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    EXPECT_EQ(0, g_nExecDepth.load());
    g_fnExec = [](BSTR, BSTR, BSTR*) -> int { ThrowHResult(E_ACCESSDENIED); };
    EXPECT_EQ(E_ACCESSDENIED, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));

    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) -> int {
        *ppResult = NewObjectLocked([] { return TestPy_NewInt(1); });
        throw std::bad_alloc();
    };
    CComVariant varResult;
    VARIANT varArg;
    V_VT(&varArg) = VT_I4;
    V_I4(&varArg) = 5;
    EXPECT_EQ(E_OUTOFMEMORY, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    EXPECT_EQ(0, g_nExecDepth.load());
    EXPECT_EQ(m_nLiveObjects, TestPy_LiveObjects());  // argument and result dropped
}

TEST_F(ServerObjectTest, CallbacksRunWithoutTheInterpreterLock)
{
    ASSERT_EQ(S_OK, StartRun());
    DispatchOutcome text;
    InvokeExec(L"cmd", nullptr, text);
    EXPECT_EQ(S_OK, text.hr);
    EXPECT_EQ(1, g_execRecord.nCalls);
    EXPECT_EQ(0u, g_execRecord.dwGilOwner);
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        *ppResult = NewObjectLocked([] { return TestPy_NewNone(); });
        return 0;
    };
    DispatchOutcome com;
    InvokeExecCom(L"cmd", DispatchArg::I4(3), com);
    EXPECT_EQ(S_OK, com.hr);
    EXPECT_EQ(1, g_execComRecord.nCalls);
    EXPECT_EQ(0u, g_execComRecord.dwGilOwner);
}

// ---- ExecCom ----------------------------------------------------------------------------------

TEST_F(ServerObjectTest, ExecComConvertsArgumentAndResult)
{
    ASSERT_EQ(S_OK, StartRun());
    struct Case
    {
        DispatchArg arg;
        int nArgKind;
        long long nArgInt;
        std::function<PyObject*()> fnResult;
        VARTYPE vtResult;
    };
    Case rgCases[] = {
        {DispatchArg::I4(42), PYDOUBLE_KIND_INT, 42, [] { return TestPy_NewStr(L"forty-two"); }, VT_BSTR},
        {DispatchArg::Bstr(L"text"), PYDOUBLE_KIND_STR, 0, [] { return TestPy_NewInt(-7); }, VT_I4},
        {DispatchArg::Empty(), PYDOUBLE_KIND_NONE, 0, [] { return TestPy_NewNone(); }, VT_EMPTY},
    };
    for (Case& test : rgCases) {
        g_fnExecCom = [&](BSTR, PyObject*, PyObject** ppResult) {
            *ppResult = NewObjectLocked(test.fnResult);
            return 0;
        };
        g_execComRecord = CallbackRecord();
        DispatchOutcome outcome;
        InvokeExecCom(L"convert", test.arg, outcome);
        EXPECT_EQ(S_OK, outcome.hr);
        EXPECT_EQ(test.nArgKind, g_execComRecord.nArgKind);
        EXPECT_EQ(test.nArgInt, g_execComRecord.nArgInt);
        EXPECT_EQ(1, g_execComRecord.nArgRefCount);  // the server's own reference
        EXPECT_TRUE(g_execComRecord.bResultSlotEmpty);
        EXPECT_EQ(L"convert", g_execComRecord.strCommand);
        EXPECT_EQ(test.vtResult, V_VT(&outcome.varResult));
        if (test.vtResult == VT_BSTR) {
            EXPECT_EQ(L"forty-two", outcome.ResultText());
        }
        if (test.vtResult == VT_I4) {
            EXPECT_EQ(-7, V_I4(&outcome.varResult));
        }
        EXPECT_EQ(m_nLiveObjects, TestPy_LiveObjects());
    }
    EXPECT_EQ(3, TestPyCom_FromVariantCalls());
    EXPECT_EQ(3, TestPyCom_ToVariantCalls());
}

TEST_F(ServerObjectTest, UnconvertibleArgumentFailsBeforeTheCallback)
{
    ASSERT_EQ(S_OK, StartRun());
    VARIANT varDouble;
    V_VT(&varDouble) = VT_R8;
    V_R8(&varDouble) = 1.5;
    DispatchOutcome outcome;
    InvokeExecCom(L"cmd", DispatchArg::Of(varDouble), outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(E_FAIL, outcome.excepInfo.scode);
    EXPECT_EQ(0, g_execComRecord.nCalls);
    EXPECT_EQ(0, g_nExecDepth.load());
}

TEST_F(ServerObjectTest, MissingOrUnconvertibleResultFails)
{
    ASSERT_EQ(S_OK, StartRun());
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    V_VT(&varArg) = VT_I4;
    V_I4(&varArg) = 1;

    g_fnExecCom = [](BSTR, PyObject*, PyObject**) { return 0; };
    CComVariant varNone;
    EXPECT_EQ(E_FAIL, m_pServer->ExecCom(bstrCommand, varArg, &varNone));
    EXPECT_EQ(VT_EMPTY, V_VT(&varNone));

    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        *ppResult = NewObjectLocked([] { return TestPy_NewUnconvertible(); });
        return 0;
    };
    CComVariant varUnconvertible;
    EXPECT_EQ(E_FAIL, m_pServer->ExecCom(bstrCommand, varArg, &varUnconvertible));
    EXPECT_EQ(VT_EMPTY, V_VT(&varUnconvertible));
    EXPECT_EQ(m_nLiveObjects, TestPy_LiveObjects());
}

TEST_F(ServerObjectTest, ExecComFailureTextArrivesInExcepInfoAndResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        *ppResult = NewObjectLocked([] { return TestPy_NewStr(L"ValueError: bad"); });
        return 1;
    };
    DispatchOutcome outcome;
    InvokeExecCom(L"cmd", DispatchArg::I4(1), outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.excepInfo.scode);
    EXPECT_EQ(L"ValueError: bad", outcome.Description());

    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    ::VariantInit(&varArg);
    CComVariant varResult;
    EXPECT_EQ(DISP_E_EXCEPTION, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    ASSERT_EQ(VT_BSTR, V_VT(&varResult));
    EXPECT_STREQ(L"ValueError: bad", V_BSTR(&varResult));
}

TEST_F(ServerObjectTest, ExecComFailureWithAnotherObjectKeepsItWithoutErrorObject)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        *ppResult = NewObjectLocked([] { return TestPy_NewInt(5); });
        return 2;
    };
    ReportErrorInfo(CLSID_ReplServer, L"stale", IID_IReplServer, DISP_E_EXCEPTION);
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    ::VariantInit(&varArg);
    CComVariant varResult;
    EXPECT_EQ(DISP_E_EXCEPTION, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    ASSERT_EQ(VT_I4, V_VT(&varResult));
    EXPECT_EQ(5, V_I4(&varResult));
    CComPtr<IErrorInfo> spInfo;
    EXPECT_EQ(S_FALSE, ::GetErrorInfo(0, &spInfo));
}

TEST_F(ServerObjectTest, ExecComClearsTheOldResultAndPassesAClearFailureOn)
{
    ASSERT_EQ(S_OK, StartRun());
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    ::VariantInit(&varArg);
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        *ppResult = NewObjectLocked([] { return TestPy_NewInt(9); });
        return 0;
    };
    CComVariant varResult;
    V_VT(&varResult) = VT_BSTR;
    V_BSTR(&varResult) = ::SysAllocString(L"old");
    EXPECT_EQ(S_OK, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    ASSERT_EQ(VT_I4, V_VT(&varResult));
    EXPECT_EQ(9, V_I4(&varResult));

    VARIANT varBad;
    ::VariantInit(&varBad);
    V_VT(&varBad) = 0x0FFF;  // no such type: clearing it fails
    HRESULT hrClear = ::VariantClear(&varBad);
    ASSERT_TRUE(FAILED(hrClear));
    V_VT(&varBad) = 0x0FFF;
    EXPECT_EQ(hrClear, m_pServer->ExecCom(bstrCommand, varArg, &varBad));
    EXPECT_EQ(1, g_execComRecord.nCalls);
}

TEST_F(ServerObjectTest, ExecComRefusesNullPointersBeforeTheCallback)
{
    ASSERT_EQ(S_OK, StartRun());
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    ::VariantInit(&varArg);
    EXPECT_EQ(E_POINTER, m_pServer->ExecCom(bstrCommand, varArg, nullptr));
    CComVariant varResult;
    EXPECT_EQ(E_INVALIDARG, m_pServer->ExecCom(nullptr, varArg, &varResult));
    EXPECT_EQ(0, g_execComRecord.nCalls);
    EXPECT_EQ(0, TestPyCom_FromVariantCalls());
}

TEST_F(ServerObjectTest, ExecComFailedPrintBecomesTheResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        g_pCurrentServer->m_hrLastPrintError = kRpcServerUnavailable;
        *ppResult = NewObjectLocked([] { return TestPy_NewStr(L"printed"); });
        return 0;
    };
    DispatchOutcome outcome;
    InvokeExecCom(L"cmd", DispatchArg::I4(1), outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(kRpcServerUnavailable, outcome.excepInfo.scode);
}

// ---- interrupts -----------------------------------------------------------------------------

TEST_F(ServerObjectTest, InterruptAtDepthOneAbortsTheCommand)
{
    ASSERT_EQ(S_OK, StartRun());
    InterruptMark mark = {-1, false};
    int nReceived = 0;
    g_fnExec = [&](BSTR, BSTR, BSTR* pResult) {
        mark = Interrupt();
        nReceived = TestPy_WaitInterrupt(kWaitMs);  // the running code sees KeyboardInterrupt
        SetResultText(pResult, L"partial");
        return 0;
    };
    CComBSTR bstrCommand(L"loop");
    CComBSTR bstrResult;
    EXPECT_EQ(E_ABORT, m_pServer->Exec(bstrCommand, nullptr, &bstrResult));
    EXPECT_EQ(1, mark.nDepth);
    EXPECT_TRUE(mark.bRaised);
    EXPECT_EQ(1, nReceived);
    EXPECT_STREQ(L"partial", bstrResult.Get());
    EXPECT_FALSE(g_bInterrupted.load());

    DispatchOutcome outcome;
    InvokeExec(L"loop", nullptr, outcome);
    EXPECT_EQ(DISP_E_EXCEPTION, outcome.hr);
    EXPECT_EQ(E_ABORT, outcome.excepInfo.scode);

    g_fnExec = nullptr;
    DispatchOutcome next;
    InvokeExec(L"next", nullptr, next);
    EXPECT_EQ(S_OK, next.hr);
    EXPECT_EQ(2, TestPy_InterruptCalls());  // one per interrupted command
}

TEST_F(ServerObjectTest, InterruptAtDepthTwoUnwindsBothCommandsAndRaisesOnce)
{
    ASSERT_EQ(S_OK, StartRun());
    struct
    {
        InterruptMark mark = {-1, false};
        long nInterruptsInInner = -1;
        HRESULT hrInner = E_UNEXPECTED;
        long nInterruptsAfterInner = -1;
        int nPendingAfterInner = -1;
        HRESULT hrRefusedExec = E_UNEXPECTED;
        HRESULT hrRefusedExecCom = E_UNEXPECTED;
        int nReceived = 0;
    } seen;
    g_fnExec = [&](BSTR Command, BSTR, BSTR* pResult) {
        if (TextOf(Command) == L"inner") {
            seen.mark = Interrupt();
            seen.nInterruptsInInner = TestPy_InterruptCalls();  // not raised while nested
            SetResultText(pResult, L"inner done");
            return 0;
        }
        DispatchOutcome inner;
        InvokeExec(L"inner", nullptr, inner);
        seen.hrInner = inner.excepInfo.scode;
        seen.nInterruptsAfterInner = TestPy_InterruptCalls();
        seen.nPendingAfterInner = TestPy_InterruptPending();
        DispatchOutcome refused;
        InvokeExec(L"inner", nullptr, refused);
        seen.hrRefusedExec = refused.excepInfo.scode;
        DispatchOutcome refusedCom;
        InvokeExecCom(L"inner", DispatchArg::I4(1), refusedCom);
        seen.hrRefusedExecCom = refusedCom.excepInfo.scode;
        seen.nReceived = TestPy_WaitInterrupt(kWaitMs);
        return 0;
    };
    DispatchOutcome outer;
    InvokeExec(L"outer", nullptr, outer);
    EXPECT_EQ(DISP_E_EXCEPTION, outer.hr);
    EXPECT_EQ(E_ABORT, outer.excepInfo.scode);
    EXPECT_EQ(2, seen.mark.nDepth);
    EXPECT_FALSE(seen.mark.bRaised);
    EXPECT_EQ(0, seen.nInterruptsInInner);
    EXPECT_EQ(E_ABORT, seen.hrInner);
    EXPECT_EQ(1, seen.nInterruptsAfterInner);
    EXPECT_EQ(1, seen.nPendingAfterInner);
    EXPECT_EQ(E_ABORT, seen.hrRefusedExec);
    EXPECT_EQ(E_ABORT, seen.hrRefusedExecCom);
    EXPECT_EQ(1, seen.nReceived);
    EXPECT_EQ(2, g_execRecord.nCalls);  // outer and the first inner only
    EXPECT_EQ(0, g_execComRecord.nCalls);
    EXPECT_EQ(1, TestPy_InterruptCalls());  // raised exactly once

    g_fnExec = nullptr;
    DispatchOutcome next;
    InvokeExec(L"next", nullptr, next);
    EXPECT_EQ(S_OK, next.hr);
}

TEST_F(ServerObjectTest, InterruptedExecComDropsItsResult)
{
    ASSERT_EQ(S_OK, StartRun());
    g_fnExecCom = [](BSTR, PyObject*, PyObject** ppResult) {
        Interrupt();
        TestPy_WaitInterrupt(kWaitMs);
        *ppResult = NewObjectLocked([] { return TestPy_NewStr(L"late"); });
        return 0;
    };
    CComBSTR bstrCommand(L"cmd");
    VARIANT varArg;
    V_VT(&varArg) = VT_I4;
    V_I4(&varArg) = 1;
    CComVariant varResult;
    EXPECT_EQ(E_ABORT, m_pServer->ExecCom(bstrCommand, varArg, &varResult));
    EXPECT_EQ(VT_EMPTY, V_VT(&varResult));
    EXPECT_EQ(0, TestPyCom_ToVariantCalls());
    EXPECT_EQ(m_nLiveObjects, TestPy_LiveObjects());
}

namespace {
// Runs outer -> inner with an interrupt inside the inner command; returns
// the outer command's EXCEPINFO code.
HRESULT RunInterruptedNesting(IDispatch* pDispatch, HMODULE hRuntime)
{
    g_fnExec = [pDispatch, hRuntime](BSTR Command, BSTR, BSTR*) {
        if (TextOf(Command) == L"inner") {
            InterruptFrom(hRuntime);
            return 0;
        }
        DispatchArg command = DispatchArg::Bstr(L"inner");
        DispatchArg argument = DispatchArg::Bstr(nullptr);
        DispatchOutcome inner;
        InvokeMethod(pDispatch, kExec, {&command, &argument}, inner);
        return 0;
    };
    DispatchArg command = DispatchArg::Bstr(L"outer");
    DispatchArg argument = DispatchArg::Bstr(nullptr);
    DispatchOutcome outer;
    InvokeMethod(pDispatch, kExec, {&command, &argument}, outer);
    return outer.excepInfo.scode;
}
}  // namespace

TEST_F(ServerObjectTest, DeferredInterruptWithoutTheTableUsesTheRuntimesOwn)
{
    ASSERT_EQ(S_OK, StartRun(Runtime(), nullptr));
    ASSERT_FALSE(m_pServer->m_python.IsBound());
    CDebugCapture capture;
    EXPECT_EQ(E_ABORT, RunInterruptedNesting(Dispatch(), Runtime()));
    EXPECT_EQ(1, TestPy_InterruptCalls());
    EXPECT_EQ(1, TestPy_InterruptPending());
    EXPECT_TRUE(capture.Lines().empty());
}

TEST_F(ServerObjectTest, DeferredInterruptWithoutSetInterruptIsLoggedNotCalled)
{
    HMODULE hNoInterrupt = ::LoadLibraryW(L"PyRuntimeNoInterrupt.dll");
    ASSERT_NE(nullptr, hNoInterrupt);
    ASSERT_EQ(S_OK, StartRun(hNoInterrupt, ComSupport()));
    ASSERT_FALSE(m_pServer->m_python.IsBound());
    CDebugCapture capture;
    EXPECT_EQ(E_ABORT, RunInterruptedNesting(Dispatch(), hNoInterrupt));
    EXPECT_EQ(std::vector<std::string>{LogLine("No Python functions found to interrupt main thread")},
              capture.Lines());
    auto pfnGilErrors = PYDOUBLE_PROC(hNoInterrupt, TestPy_GilErrors);
    auto pfnGilOwner = PYDOUBLE_PROC(hNoInterrupt, TestPy_GilOwner);
    ASSERT_NE(nullptr, pfnGilErrors);
    EXPECT_EQ(0, pfnGilErrors());
    EXPECT_EQ(0u, pfnGilOwner());
    EXPECT_EQ(S_OK, m_pServer->Quit());
    ReleaseServer();
    ::FreeLibrary(hNoInterrupt);
}

TEST_F(ServerObjectTest, DeferredInterruptWithoutARuntimeIsLogged)
{
    ASSERT_EQ(S_OK, StartRun(nullptr, nullptr));
    CDebugCapture capture;
    EXPECT_EQ(E_ABORT, RunInterruptedNesting(Dispatch(), Runtime()));
    EXPECT_EQ(std::vector<std::string>{LogLine("No Python module given")}, capture.Lines());
    EXPECT_EQ(0, TestPy_InterruptCalls());
}

namespace {
struct HammerState
{
    std::atomic<bool> bStop{false};
    std::atomic<long> nMarks{0};
};

DWORD WINAPI HammerInterrupts(LPVOID pv)
{
    HammerState* pState = static_cast<HammerState*>(pv);
    while (!pState->bStop) {
        int nState = PyGILState_Ensure();
        if (MarkInterrupt(&PyErr_SetInterrupt).nDepth > 0) ++pState->nMarks;
        PyGILState_Release(nState);
    }
    return 0;
}
}  // namespace

TEST_F(ServerObjectTest, FlagsAreClearAtRestEvenWhenInterruptsRaceTheEnd)
{
    ASSERT_EQ(S_OK, StartRun());
    HammerState state;
    CHandle hThread(::CreateThread(nullptr, 0, HammerInterrupts, &state, 0, nullptr));
    ASSERT_TRUE(hThread.IsValid());
    // Enough commands for the interrupts to land in every phase of the bracket.
    const int kMinCommands = 3000;
    const long kMinMarks = 50;
    const DWORD dwDeadline = ::GetTickCount() + 5000;
    int nCommands = 0;
    int nFlagsSetAtRest = 0;
    int nRefusedBeforeCallback = 0;
    CComBSTR bstrCommand(L"cmd");
    while (nCommands < kMinCommands || (state.nMarks < kMinMarks && ::GetTickCount() < dwDeadline)) {
        int nCallsBefore = g_execRecord.nCalls;
        CComBSTR bstrResult;
        m_pServer->Exec(bstrCommand, nullptr, &bstrResult);
        ++nCommands;
        if (g_execRecord.nCalls == nCallsBefore) ++nRefusedBeforeCallback;
        if (g_bInterrupted || g_bInterruptPending) ++nFlagsSetAtRest;
    }
    state.bStop = true;
    ASSERT_EQ(WAIT_OBJECT_0, ::WaitForSingleObject(hThread.Get(), kWaitMs));
    EXPECT_EQ(0, nFlagsSetAtRest);
    EXPECT_EQ(0, nRefusedBeforeCallback);
    EXPECT_GE(state.nMarks.load(), kMinMarks);  // the interrupts did land during commands
}
