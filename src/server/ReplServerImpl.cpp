#include "server/ReplServerImpl.h"

#include <utility>

#include "diag/LogError.h"
#include "server/ExecState.h"

CComObject<KxCIReplServerImpl>* g_pCurrentServer = nullptr;

namespace {

const DISPID kDispIdConnect = 1;
const DISPID kDispIdDetach = 4;

const InterfaceMapEntry<KxCIReplServerImpl> g_rgInterfaceMap[] = {
    {&IID_IReplServer, &InterfaceFace<KxCIReplServerImpl, IReplServer>},
    {&IID_IDispatch, &InterfaceFace<KxCIReplServerImpl, IReplServer>},
    {&IID_ISupportErrorInfo, &InterfaceFace<KxCIReplServerImpl, ISupportErrorInfo>},
    {nullptr, nullptr},
};

// A log line that cannot be allocated is dropped: it must not turn a COM
// method's result into an exception.
void LogErrorNoThrow(const char* pszMessage) noexcept
{
    try {
        LogError(pszMessage);
    } catch (...) {
    }
}

// Keeps the object alive across a call into foreign code that may drop
// every other reference (a command that makes the server quit, a client
// that quits from inside Detach).
class CSelfReference
{
public:
    explicit CSelfReference(IUnknown* pUnk) noexcept : m_pUnk(pUnk) { m_pUnk->AddRef(); }
    CSelfReference(const CSelfReference&) = delete;
    CSelfReference& operator=(const CSelfReference&) = delete;
    ~CSelfReference() { m_pUnk->Release(); }

private:
    IUnknown* m_pUnk;
};

// BeginExec .. EndExec around one callback. The depth goes back down even
// when the callback unwinds, so the interrupt flags cannot stick.
class CExecBracket
{
public:
    explicit CExecBracket(KxCIReplServerImpl& server) noexcept : m_server(server) { m_server.BeginExec(); }
    CExecBracket(const CExecBracket&) = delete;
    CExecBracket& operator=(const CExecBracket&) = delete;
    ~CExecBracket()
    {
        if (!m_bEnded) m_server.EndExec();
    }
    // True when the command was interrupted.
    bool End() noexcept
    {
        m_bEnded = true;
        return m_server.EndExec();
    }

private:
    KxCIReplServerImpl& m_server;
    bool m_bEnded = false;
};

// The argument and result objects of one ExecCom. They are dropped under the
// interpreter lock: normally inside the caller's own lock scope
// (DropLocked), otherwise on unwind.
class CExecComObjects
{
public:
    CExecComObjects(const PythonFunctions& python, PyObject* pyArg) noexcept : m_python(python), m_pyArg(pyArg) {}
    CExecComObjects(const CExecComObjects&) = delete;
    CExecComObjects& operator=(const CExecComObjects&) = delete;
    ~CExecComObjects()
    {
        if (m_pyArg == nullptr && m_pyResult == nullptr) return;
        CGilLock gil(m_python);
        DropLocked();
    }

    PyObject** ResultSlot() noexcept { return &m_pyResult; }
    PyObject* Result() const noexcept { return m_pyResult; }
    void DropLocked() noexcept
    {
        if (m_pyResult != nullptr) m_python.Py_DecRef(std::exchange(m_pyResult, nullptr));
        if (m_pyArg != nullptr) m_python.Py_DecRef(std::exchange(m_pyArg, nullptr));
    }

private:
    const PythonFunctions& m_python;
    PyObject* m_pyArg;
    PyObject* m_pyResult = nullptr;
};

// The result of a command that ran to its end.
HRESULT CompletedResult(HRESULT hrLastPrintError) noexcept
{
    return hrLastPrintError < 0 ? hrLastPrintError : S_OK;
}

// A failure without an error object of its own clears the thread's current
// one, so that the caller never reads a stale description with it.
HRESULT ForgetStaleErrorInfo(HRESULT hr, bool bReported) noexcept
{
    if (FAILED(hr) && !bReported) ::SetErrorInfo(0, nullptr);
    return hr;
}

}  // namespace

const InterfaceMapEntry<KxCIReplServerImpl>* KxCIReplServerImpl::_GetEntries() noexcept
{
    return g_rgInterfaceMap;
}

HRESULT CreateServerObject(CComObject<KxCIReplServerImpl>** ppObject) noexcept
{
    return CComObject<KxCIReplServerImpl>::CreateInstance(ppObject);
}

// ---- connecting and quitting ------------------------------------------------------

HRESULT KxCIReplServerImpl::Init(IDispatch* pClient, HMODULE hPythonDLL, HMODULE hPythonComDLL, ExecProc pExecProc,
                                 ExecComProc pExecComProc)
{
    if (pClient == nullptr || pExecProc == nullptr) return E_INVALIDARG;
    m_pExecProc = pExecProc;
    m_pExecComProc = pExecComProc;
    m_spClient = pClient;
    m_hPythonDLL = hPythonDLL;
    BindPythonFunctions(m_python, hPythonDLL, hPythonComDLL);
    return ConnectClient();
}

HRESULT KxCIReplServerImpl::ConnectClient() noexcept
{
    CComPtr<IDispatch> spSelf;
    HRESULT hr = PrimaryFace()->QueryInterface(IID_IDispatch, reinterpret_cast<void**>(&spSelf));
    if (FAILED(hr)) return hr;

    CComPtr<IDispatch> spClient(m_spClient);
    CComVariant varServer;
    V_VT(&varServer) = VT_DISPATCH;
    V_DISPATCH(&varServer) = spSelf;
    spSelf->AddRef();  // the argument's own reference, dropped with the VARIANT
    DISPPARAMS params = {&varServer, nullptr, 1, 0};
    hr = spClient->Invoke(kDispIdConnect, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params, nullptr, nullptr,
                          nullptr);
    if (FAILED(hr)) {
        LogErrorNoThrow("Client call of Connect failed");
        return hr;
    }
    // A client that already quit from inside Connect ended the run.
    if (!m_spClient) return hr;
    if (!m_bHoldsRunReference) {
        PrimaryFace()->AddRef();
        m_bHoldsRunReference = true;
    }
    g_pCurrentServer = static_cast<CComObject<KxCIReplServerImpl>*>(this);
    return hr;
}

STDMETHODIMP KxCIReplServerImpl::Quit()
{
    CSelfReference self(PrimaryFace());
    // Taken out before Detach: a Quit re-entered meanwhile finds no client,
    // so no client is ever detached twice.
    CComPtr<IDispatch> spClient(std::move(m_spClient));
    if (spClient) {
        DISPPARAMS params = {nullptr, nullptr, 0, 0};
        HRESULT hr = spClient->Invoke(kDispIdDetach, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params,
                                      nullptr, nullptr, nullptr);
        if (FAILED(hr)) LogErrorNoThrow("Client call of Detach failed");
    }
    m_pExecProc = nullptr;
    m_pExecComProc = nullptr;
    spClient.Release();
    if (g_pCurrentServer == this) g_pCurrentServer = nullptr;

    // Only the Quit that gives back the run's reference ends the run; a
    // repeated one must neither release again nor end a later run's loop.
    if (!std::exchange(m_bHoldsRunReference, false)) return S_OK;
    PrimaryFace()->Release();
    ::PostQuitMessage(0);
    return S_OK;
}

void KxCIReplServerImpl::FinalRelease() noexcept
{
    m_pExecProc = nullptr;
    m_pExecComProc = nullptr;
    m_spClient.Release();
    // An old run's object may die during a later run: leave that run's server alone.
    if (g_pCurrentServer == this) g_pCurrentServer = nullptr;
}

// ---- commands ---------------------------------------------------------------------

STDMETHODIMP KxCIReplServerImpl::Exec(BSTR Command, BSTR Argument, BSTR* pResult)
{
    CSelfReference self(PrimaryFace());
    HRESULT hr = E_FAIL;
    bool bReported = false;
    try {
        hr = ExecText(Command, Argument, pResult, bReported);
    } catch (...) {
        hr = HResultFromCurrentException();
    }
    return ForgetStaleErrorInfo(hr, bReported);
}

HRESULT KxCIReplServerImpl::ExecText(BSTR Command, BSTR Argument, BSTR* pResult, bool& bReported)
{
    if (pResult == nullptr) return E_POINTER;
    *pResult = nullptr;
    if (g_bInterrupted) return E_ABORT;
    if (Command == nullptr) return E_INVALIDARG;
    ExecProc pExecProc = m_pExecProc;
    if (pExecProc == nullptr) return E_FAIL;

    int nRc = 0;
    bool bInterrupted = false;
    {
        CExecBracket bracket(*this);
        nRc = pExecProc(Command, Argument, pResult);
        bInterrupted = bracket.End();
    }
    if (bInterrupted) return E_ABORT;
    if (nRc == 0) return CompletedResult(m_hrLastPrintError);
    // The failure text stays in *pResult as well: it belongs to the caller.
    if (*pResult != nullptr) {
        Error(*pResult, IID_IReplServer, DISP_E_EXCEPTION);
        bReported = true;
    }
    return DISP_E_EXCEPTION;
}

STDMETHODIMP KxCIReplServerImpl::ExecCom(BSTR Command, VARIANT Argument, VARIANT* pResult)
{
    CSelfReference self(PrimaryFace());
    HRESULT hr = E_FAIL;
    bool bReported = false;
    try {
        hr = ExecVariant(Command, &Argument, pResult, bReported);
    } catch (...) {
        hr = HResultFromCurrentException();
    }
    return ForgetStaleErrorInfo(hr, bReported);
}

HRESULT KxCIReplServerImpl::ExecVariant(BSTR Command, VARIANT* pArgument, VARIANT* pResult, bool& bReported)
{
    if (pResult == nullptr) return E_POINTER;
    HRESULT hr = ::VariantClear(pResult);
    if (FAILED(hr)) return hr;
    if (g_bInterrupted) return E_ABORT;
    if (Command == nullptr) return E_INVALIDARG;
    ExecComProc pExecComProc = m_pExecComProc;
    if (pExecComProc == nullptr || !m_python.IsBound()) return E_NOTIMPL;

    PyObject* pyArg = PyObjectFromVariantLocked(pArgument);
    if (pyArg == nullptr) return E_FAIL;
    CExecComObjects objects(m_python, pyArg);
    int nRc = 0;
    bool bInterrupted = false;
    {
        CExecBracket bracket(*this);
        nRc = pExecComProc(Command, pyArg, objects.ResultSlot());
        bInterrupted = bracket.End();
    }
    CGilLock gil(m_python);
    hr = FinishExecCom(nRc, bInterrupted, objects.Result(), pResult, bReported);
    objects.DropLocked();
    return hr;
}

HRESULT KxCIReplServerImpl::FinishExecCom(int nRc, bool bInterrupted, PyObject* pyResult, VARIANT* pResult,
                                          bool& bReported) noexcept
{
    if (bInterrupted) return E_ABORT;
    if (pyResult == nullptr) return E_FAIL;
    if (!m_python.PyCom_VariantFromPyObject(pyResult, pResult)) return E_FAIL;
    if (nRc == 0) return CompletedResult(m_hrLastPrintError);
    // The converted failure object stays in *pResult.
    if (V_VT(pResult) == VT_BSTR && V_BSTR(pResult) != nullptr) {
        Error(V_BSTR(pResult), IID_IReplServer, DISP_E_EXCEPTION);
        bReported = true;
    }
    return DISP_E_EXCEPTION;
}

PyObject* KxCIReplServerImpl::PyObjectFromVariantLocked(VARIANT* pVar) noexcept
{
    if (!m_python.IsBound()) return nullptr;
    CGilLock gil(m_python);
    return m_python.PyCom_PyObjectFromVariant(pVar);
}

// ---- the command bracket ----------------------------------------------------------

void KxCIReplServerImpl::BeginExec() noexcept
{
    m_hrLastPrintError = S_OK;
    EnterExecDepth();
}

bool KxCIReplServerImpl::EndExec() noexcept
{
    ExecLeaveResult result = LeaveExecDepth();
    if (result.bRaiseDeferred) RaiseDeferredInterrupt();
    return result.bInterrupted;
}

void KxCIReplServerImpl::RaiseDeferredInterrupt() noexcept
{
    if (m_python.IsBound()) {
        CGilLock gil(m_python);
        m_python.PyErr_SetInterrupt();
        return;
    }
    // Without the table, ask the runtime itself, as the interrupt routine does.
    if (m_hPythonDLL == nullptr) {
        LogErrorNoThrow("No Python module given");
        return;
    }
    auto pfnEnsure = GetPythonProc<PFN_PyGILState_Ensure>(m_hPythonDLL, "PyGILState_Ensure");
    auto pfnRelease = GetPythonProc<PFN_PyGILState_Release>(m_hPythonDLL, "PyGILState_Release");
    if (pfnEnsure == nullptr || pfnRelease == nullptr) {
        LogErrorNoThrow("No Python functions found to lock the GIL state");
        return;
    }
    auto pfnSetInterrupt = GetPythonProc<PFN_PyErr_SetInterrupt>(m_hPythonDLL, "PyErr_SetInterrupt");
    if (pfnSetInterrupt == nullptr) {
        LogErrorNoThrow("No Python functions found to interrupt main thread");
        return;
    }
    CGilLock gil(pfnEnsure, pfnRelease);
    pfnSetInterrupt();
}
