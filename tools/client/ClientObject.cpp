#include "client/ClientObject.h"

#include <deque>
#include <map>
#include <new>

namespace {

std::wstring BstrText(BSTR bstr)
{
    return bstr ? std::wstring(bstr, ::SysStringLen(bstr)) : std::wstring();
}

struct MethodName
{
    const wchar_t* pszName;
    DISPID dispid;
    UINT cArgs;
};

const MethodName kMethods[] = {
    {L"Connect", CReplClientObject::DISPID_CONNECT, 1},
    {L"Print", CReplClientObject::DISPID_PRINT, 2},
    {L"GetUserInput", CReplClientObject::DISPID_GETUSERINPUT, 1},
    {L"Detach", CReplClientObject::DISPID_DETACH, 0},
};

const MethodName* FindMethod(DISPID dispid)
{
    for (const MethodName& method : kMethods) {
        if (method.dispid == dispid) return &method;
    }
    return nullptr;
}

// Argument nIndex (rgvarg order) as vt, converted as a late-bound call
// would; an argument of that type already is taken as it is (a copy could
// turn a null BSTR into an empty one).
HRESULT ArgAs(DISPPARAMS* pParams, UINT nIndex, VARTYPE vt, CComVariant& varConverted, const VARIANT** ppvar,
              UINT* puArgErr)
{
    const VARIANT* pvarArg = &pParams->rgvarg[nIndex];
    if (V_VT(pvarArg) == vt) {
        *ppvar = pvarArg;
        return S_OK;
    }
    if (FAILED(::VariantChangeType(&varConverted, const_cast<VARIANT*>(pvarArg), 0, vt))) {
        if (puArgErr) *puArgErr = nIndex;
        return DISP_E_TYPEMISMATCH;
    }
    *ppvar = &varConverted;
    return S_OK;
}

}  // namespace

// ---- CInputAnswer ------------------------------------------------------------------

CInputAnswer::CInputAnswer() = default;

CInputAnswer CInputAnswer::Text(const std::wstring& strText)
{
    CInputAnswer answer;
    auto spValue = std::make_shared<CComVariant>();
    V_BSTR(spValue.get()) = ::SysAllocStringLen(strText.data(), static_cast<UINT>(strText.size()));
    if (V_BSTR(spValue.get()) == nullptr) ThrowHResult(E_OUTOFMEMORY);
    V_VT(spValue.get()) = VT_BSTR;
    answer.m_spValue = std::move(spValue);
    return answer;
}

CInputAnswer CInputAnswer::NoInput()
{
    return CInputAnswer();
}

CInputAnswer CInputAnswer::Failure(HRESULT hr)
{
    CInputAnswer answer;
    answer.m_hr = hr;
    return answer;
}

CInputAnswer CInputAnswer::Value(const VARIANT& var)
{
    CInputAnswer answer;
    auto spValue = std::make_shared<CComVariant>();
    HRESULT hr = ::VariantCopy(spValue.get(), const_cast<VARIANT*>(&var));
    if (FAILED(hr)) ThrowHResult(hr);
    answer.m_spValue = std::move(spValue);
    return answer;
}

HRESULT CInputAnswer::Answer(VARIANT* pvarResult) const noexcept
{
    if (FAILED(m_hr) || pvarResult == nullptr || !m_spValue) return m_hr;
    HRESULT hr = ::VariantCopy(pvarResult, const_cast<CComVariant*>(m_spValue.get()));
    return FAILED(hr) ? hr : m_hr;
}

std::wstring CInputAnswer::TextOrEmpty() const
{
    return m_spValue && V_VT(m_spValue.get()) == VT_BSTR ? BstrText(V_BSTR(m_spValue.get())) : std::wstring();
}

// ---- CReplClientObject -------------------------------------------------------------

struct CReplClientObject::State
{
    struct Result
    {
        HRESULT hr;
        size_t nFromCall;
    };

    mutable CCritSec cs;
    std::vector<Call> vecCalls;
    bool bRecording = true;
    size_t nCalls = 0;                   // all calls since creation
    std::map<DISPID, size_t> mapCounts;  // calls per dispid since creation
    std::map<DISPID, Result> mapResults;
    std::deque<CInputAnswer> queInput;
    CInputAnswer defaultInput;
    PrintHandler fnPrint;
    InputHandler fnInput;
    CallHook fnHook;
    CComPtr<IDispatch> spServer;
    bool bDetached = false;
    size_t nPrints = 0;
    std::map<size_t, CHandle> mapPrintEvents;
};

CReplClientObject::CReplClientObject()
    : m_pState(new State),
      m_hConnected(::CreateEventW(nullptr, TRUE, FALSE, nullptr)),
      m_hDetached(::CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
}

CReplClientObject::~CReplClientObject() = default;

CComPtr<CReplClientObject> CReplClientObject::Create() noexcept
{
    CReplClientObject* pObject = new (std::nothrow) CReplClientObject();
    if (pObject == nullptr) return CComPtr<CReplClientObject>();
    CComPtr<CReplClientObject> spObject(pObject);
    if (!pObject->m_hConnected || !pObject->m_hDetached || !pObject->m_pState->cs.IsValid()) {
        return CComPtr<CReplClientObject>();
    }
    return spObject;
}

// ---- configuration and observation ----------------------------------------------

void CReplClientObject::SetResult(DISPID dispid, HRESULT hr, size_t nFromCall)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->mapResults[dispid] = {hr, nFromCall};
}

void CReplClientObject::SetRecording(bool bRecord)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->bRecording = bRecord;
}

void CReplClientObject::QueueInput(const CInputAnswer& answer)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->queInput.push_back(answer);
}

void CReplClientObject::SetDefaultInput(const CInputAnswer& answer)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->defaultInput = answer;
}

void CReplClientObject::SetPrintHandler(PrintHandler fnHandler)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->fnPrint = std::move(fnHandler);
}

void CReplClientObject::SetInputHandler(InputHandler fnHandler)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->fnInput = std::move(fnHandler);
}

void CReplClientObject::SetCallHook(CallHook fnHook)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->fnHook = std::move(fnHook);
}

std::vector<CReplClientObject::Call> CReplClientObject::Calls() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->vecCalls;
}

std::vector<CReplClientObject::Call> CReplClientObject::CallsOf(DISPID dispid) const
{
    std::vector<Call> vecCalls;
    CCritSecLock lock(m_pState->cs);
    for (const Call& call : m_pState->vecCalls) {
        if (call.dispid == dispid) vecCalls.push_back(call);
    }
    return vecCalls;
}

size_t CReplClientObject::CountOf(DISPID dispid) const
{
    return CallsOf(dispid).size();
}

std::wstring CReplClientObject::Output(bool bIsError) const
{
    std::wstring strOutput;
    CCritSecLock lock(m_pState->cs);
    for (const Call& call : m_pState->vecCalls) {
        if (call.dispid == DISPID_PRINT && call.bIsError == bIsError && SUCCEEDED(call.hrAnswer)) {
            strOutput += call.strText;
        }
    }
    return strOutput;
}

void CReplClientObject::ClearCalls()
{
    CCritSecLock lock(m_pState->cs);
    m_pState->vecCalls.clear();
}

size_t CReplClientObject::CallCount() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->nCalls;
}

CComPtr<IDispatch> CReplClientObject::Server() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->spServer;
}

HANDLE CReplClientObject::PrintCountEvent(size_t nPrints)
{
    CCritSecLock lock(m_pState->cs);
    CHandle& hEvent = m_pState->mapPrintEvents[nPrints];
    if (!hEvent) {
        hEvent.Reset(::CreateEventW(nullptr, TRUE, m_pState->nPrints >= nPrints, nullptr));
    }
    return hEvent.Get();
}

bool CReplClientObject::IsConnected() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->spServer != nullptr;
}

bool CReplClientObject::WasDetached() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->bDetached;
}

ULONG CReplClientObject::RefCount() const noexcept
{
    return static_cast<ULONG>(::InterlockedCompareExchange(const_cast<LONG*>(&m_nRef), 0, 0));
}

void CReplClientObject::DisconnectRemotes() noexcept
{
    // Keeps the object alive while COM drops the references it held.
    CComPtr<CReplClientObject> spSelf(this);
    ::CoDisconnectObject(static_cast<IReplClient*>(this), 0);
}

// ---- handling one call -------------------------------------------------------------

HRESULT CReplClientObject::ConfiguredResult(DISPID dispid, size_t nCall) const
{
    CCritSecLock lock(m_pState->cs);
    auto it = m_pState->mapResults.find(dispid);
    return it != m_pState->mapResults.end() && nCall >= it->second.nFromCall ? it->second.hr : S_OK;
}

HRESULT CReplClientObject::RunHook(const Call& call, HRESULT hr)
{
    CallHook fnHook;
    {
        CCritSecLock lock(m_pState->cs);
        fnHook = m_pState->fnHook;
    }
    if (!fnHook) return hr;
    std::optional<HRESULT> hrHook = fnHook(call);
    return hrHook ? *hrHook : hr;
}

HRESULT CReplClientObject::HandleConnect(IDispatch* pServer)
{
    if (pServer == nullptr) return E_POINTER;
    {
        CCritSecLock lock(m_pState->cs);
        m_pState->spServer = pServer;
    }
    ::SetEvent(m_hConnected.Get());
    return S_OK;
}

HRESULT CReplClientObject::HandlePrint(const Call& call)
{
    PrintHandler fnPrint;
    {
        CCritSecLock lock(m_pState->cs);
        fnPrint = m_pState->fnPrint;
    }
    if (fnPrint) fnPrint(call.strText, call.bIsError);
    return S_OK;
}

HRESULT CReplClientObject::HandleInput(Call& call, VARIANT* pVarResult)
{
    std::optional<CInputAnswer> answer;
    InputHandler fnInput;
    {
        CCritSecLock lock(m_pState->cs);
        if (!m_pState->queInput.empty()) {
            answer = m_pState->queInput.front();
            m_pState->queInput.pop_front();
        } else if (!m_pState->fnInput) {
            answer = m_pState->defaultInput;
        }
        fnInput = m_pState->fnInput;
    }
    if (!answer) answer = fnInput(call.strText);
    call.strAnswer = answer->TextOrEmpty();
    return answer->Answer(pVarResult);
}

HRESULT CReplClientObject::HandleDetach()
{
    CComPtr<IDispatch> spServer;
    {
        CCritSecLock lock(m_pState->cs);
        spServer = std::move(m_pState->spServer);
        m_pState->bDetached = true;
    }
    ::SetEvent(m_hDetached.Get());
    // spServer goes here, outside the lock: releasing a proxy calls the server.
    return S_OK;
}

// Counts the call and, when recording, keeps it in arrival order; gives its
// number among the calls of its kind.
size_t CReplClientObject::Arrive(Call& call)
{
    CCritSecLock lock(m_pState->cs);
    call.nSequence = ++m_pState->nCalls;
    size_t nOfKind = ++m_pState->mapCounts[call.dispid];
    if (m_pState->bRecording) m_pState->vecCalls.push_back(call);
    if (call.dispid == DISPID_PRINT) {
        ++m_pState->nPrints;
        for (auto& entry : m_pState->mapPrintEvents) {
            if (entry.first <= m_pState->nPrints) ::SetEvent(entry.second.Get());
        }
    }
    return nOfKind;
}

// Does what a call means, unless it is to fail.
HRESULT CReplClientObject::Perform(Call& call, HRESULT hr, IDispatch* pServer, VARIANT* pVarResult)
{
    if (FAILED(hr)) {
        if (call.dispid == DISPID_DETACH) HandleDetach();  // the connection ends all the same
        return hr;
    }
    switch (call.dispid) {
    case DISPID_CONNECT: return HandleConnect(pServer);
    case DISPID_PRINT: return HandlePrint(call);
    case DISPID_GETUSERINPUT: return HandleInput(call, pVarResult);
    default: return HandleDetach();
    }
}

// Gives the kept record its answer (it may be gone: ClearCalls).
void CReplClientObject::Complete(const Call& call)
{
    CCritSecLock lock(m_pState->cs);
    for (auto it = m_pState->vecCalls.rbegin(); it != m_pState->vecCalls.rend(); ++it) {
        if (it->nSequence == call.nSequence) {
            it->hrAnswer = call.hrAnswer;
            it->strAnswer = call.strAnswer;
            return;
        }
    }
}

HRESULT CReplClientObject::Dispatch(Call& call, IDispatch* pServer, VARIANT* pVarResult) noexcept
{
    try {
        call.dwThreadId = ::GetCurrentThreadId();
        size_t nOfKind = Arrive(call);
        HRESULT hr = RunHook(call, ConfiguredResult(call.dispid, nOfKind));
        call.hrAnswer = Perform(call, hr, pServer, pVarResult);
        Complete(call);
        return call.hrAnswer;
    } catch (...) {
        return HResultFromCurrentException();
    }
}

// ---- IUnknown ----------------------------------------------------------------------

STDMETHODIMP CReplClientObject::QueryInterface(REFIID riid, void** ppv)
{
    if (ppv == nullptr) return E_POINTER;
    if (riid == IID_IUnknown || riid == IID_IDispatch || riid == __uuidof(IReplClient)) {
        *ppv = static_cast<IReplClient*>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

STDMETHODIMP_(ULONG) CReplClientObject::AddRef()
{
    return static_cast<ULONG>(::InterlockedIncrement(&m_nRef));
}

STDMETHODIMP_(ULONG) CReplClientObject::Release()
{
    LONG nRef = ::InterlockedDecrement(&m_nRef);
    if (nRef == 0) delete this;
    return static_cast<ULONG>(nRef);
}

// ---- IDispatch ---------------------------------------------------------------------

STDMETHODIMP CReplClientObject::GetTypeInfoCount(UINT* pctinfo)
{
    if (pctinfo == nullptr) return E_POINTER;
    *pctinfo = 0;
    return S_OK;
}

STDMETHODIMP CReplClientObject::GetTypeInfo(UINT, LCID, ITypeInfo** ppTInfo)
{
    if (ppTInfo == nullptr) return E_POINTER;
    *ppTInfo = nullptr;
    return DISP_E_BADINDEX;
}

STDMETHODIMP CReplClientObject::GetIDsOfNames(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID, DISPID* rgDispId)
{
    if (riid != IID_NULL) return DISP_E_UNKNOWNINTERFACE;
    if (rgszNames == nullptr || rgDispId == nullptr || cNames == 0) return E_INVALIDARG;
    HRESULT hr = S_OK;
    for (UINT i = 0; i < cNames; ++i) rgDispId[i] = DISPID_UNKNOWN;
    for (const MethodName& method : kMethods) {
        if (rgszNames[0] != nullptr && ::_wcsicmp(rgszNames[0], method.pszName) == 0) rgDispId[0] = method.dispid;
    }
    // Parameter names are not known: only positional arguments are taken.
    for (UINT i = 0; i < cNames; ++i) {
        if (rgDispId[i] == DISPID_UNKNOWN) hr = DISP_E_UNKNOWNNAME;
    }
    return hr;
}

STDMETHODIMP CReplClientObject::Invoke(DISPID dispid, REFIID riid, LCID, WORD wFlags, DISPPARAMS* pParams,
                                       VARIANT* pVarResult, EXCEPINFO*, UINT* puArgErr)
{
    if (riid != IID_NULL) return DISP_E_UNKNOWNINTERFACE;
    const MethodName* pMethod = FindMethod(dispid);
    if (pMethod == nullptr || (wFlags & DISPATCH_METHOD) == 0) return DISP_E_MEMBERNOTFOUND;
    DISPPARAMS noParams = {nullptr, nullptr, 0, 0};
    if (pParams == nullptr) pParams = &noParams;
    if (pParams->cNamedArgs != 0) return DISP_E_NONAMEDARGS;
    if (pParams->cArgs != pMethod->cArgs) return DISP_E_BADPARAMCOUNT;
    try {
        Call call;
        call.dispid = dispid;
        call.wFlags = wFlags;
        call.cArgs = pParams->cArgs;
        CComVariant varServer, varText, varIsError;
        const VARIANT* pvarServer = nullptr;
        const VARIANT* pvarText = nullptr;
        const VARIANT* pvarIsError = nullptr;
        HRESULT hr = S_OK;
        if (dispid == DISPID_CONNECT) hr = ArgAs(pParams, 0, VT_DISPATCH, varServer, &pvarServer, puArgErr);
        if (dispid == DISPID_GETUSERINPUT) hr = ArgAs(pParams, 0, VT_BSTR, varText, &pvarText, puArgErr);
        if (dispid == DISPID_PRINT) {
            hr = ArgAs(pParams, 1, VT_BSTR, varText, &pvarText, puArgErr);
            if (SUCCEEDED(hr)) hr = ArgAs(pParams, 0, VT_BOOL, varIsError, &pvarIsError, puArgErr);
        }
        if (FAILED(hr)) return hr;
        if (pvarText) {
            call.strText = BstrText(V_BSTR(pvarText));
            call.bNullText = V_BSTR(pvarText) == nullptr;
        }
        call.nIsError = pvarIsError ? V_BOOL(pvarIsError) : VARIANT_FALSE;
        call.bIsError = call.nIsError != VARIANT_FALSE;
        if (pVarResult) ::VariantInit(pVarResult);
        return Dispatch(call, pvarServer ? V_DISPATCH(pvarServer) : nullptr, pVarResult);
    } catch (...) {
        return HResultFromCurrentException();
    }
}

// ---- IReplClient, for callers in this process --------------------------------------

STDMETHODIMP CReplClientObject::Connect(IDispatch* pServer)
{
    Call call;
    call.dispid = DISPID_CONNECT;
    call.cArgs = 1;
    return Dispatch(call, pServer, nullptr);
}

STDMETHODIMP CReplClientObject::Print(BSTR Text, VARIANT_BOOL bIsError)
{
    try {
        Call call;
        call.dispid = DISPID_PRINT;
        call.cArgs = 2;
        call.strText = BstrText(Text);
        call.bNullText = Text == nullptr;
        call.nIsError = bIsError;
        call.bIsError = bIsError != VARIANT_FALSE;
        return Dispatch(call, nullptr, nullptr);
    } catch (...) {
        return HResultFromCurrentException();
    }
}

STDMETHODIMP CReplClientObject::GetUserInput(BSTR Prompt, BSTR* pRes)
{
    if (pRes == nullptr) return E_POINTER;
    *pRes = nullptr;
    try {
        Call call;
        call.dispid = DISPID_GETUSERINPUT;
        call.cArgs = 1;
        call.strText = BstrText(Prompt);
        call.bNullText = Prompt == nullptr;
        CComVariant varAnswer;
        HRESULT hr = Dispatch(call, nullptr, &varAnswer);
        if (SUCCEEDED(hr) && V_VT(&varAnswer) == VT_BSTR) {
            *pRes = V_BSTR(&varAnswer);
            V_VT(&varAnswer) = VT_EMPTY;
        }
        return hr;
    } catch (...) {
        return HResultFromCurrentException();
    }
}

STDMETHODIMP CReplClientObject::Detach()
{
    Call call;
    call.dispid = DISPID_DETACH;
    return Dispatch(call, nullptr, nullptr);
}
