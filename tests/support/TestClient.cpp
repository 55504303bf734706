#include "TestClient.h"

#include <map>
#include <new>

#include "common/Raii.h"

namespace {
std::atomic<LONG>* LiveCounter()
{
    static std::atomic<LONG> s_nLive{0};
    return &s_nLive;
}

CTestClient::Arg RecordArg(const VARIANT& var)
{
    CTestClient::Arg arg;
    arg.vt = V_VT(&var);
    switch (V_VT(&var)) {
    case VT_BSTR:
        arg.bNullBstr = V_BSTR(&var) == nullptr;
        if (!arg.bNullBstr) arg.strText.assign(V_BSTR(&var), ::SysStringLen(V_BSTR(&var)));
        break;
    case VT_BOOL:
        arg.nValue = V_BOOL(&var);
        break;
    case VT_I2:
        arg.nValue = V_I2(&var);
        break;
    case VT_I4:
        arg.nValue = V_I4(&var);
        break;
    case VT_DISPATCH:
        arg.pDispatch = V_DISPATCH(&var);
        break;
    default:
        break;
    }
    return arg;
}
}  // namespace

struct CTestClient::State
{
    CCritSec cs;
    std::vector<Call> calls;
    std::map<DISPID, HRESULT> results;
    std::map<DISPID, Hook> hooks;
    CComVariant input;
};

CTestClient* CTestClient::Create() noexcept
{
    try {
        return new CTestClient();
    } catch (...) {
        return nullptr;
    }
}

CTestClient::CTestClient() : m_pState(nullptr)
{
    m_pState = new State();
    V_VT(&m_pState->input) = VT_BSTR;
    V_BSTR(&m_pState->input) = ::SysAllocString(L"input");
    ++*LiveCounter();
}

CTestClient::~CTestClient()
{
    delete m_pState;
    --*LiveCounter();
}

void CTestClient::SetResult(DISPID dispid, HRESULT hr)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->results[dispid] = hr;
}

void CTestClient::SetInputResult(const VARIANT& var)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->input.Clear();
    HRESULT hr = ::VariantCopy(&m_pState->input, const_cast<VARIANT*>(&var));
    if (FAILED(hr)) ThrowHResult(hr);
}

void CTestClient::SetHook(DISPID dispid, Hook hook)
{
    CCritSecLock lock(m_pState->cs);
    m_pState->hooks[dispid] = std::move(hook);
}

std::vector<CTestClient::Call> CTestClient::Calls() const
{
    CCritSecLock lock(m_pState->cs);
    return m_pState->calls;
}

std::vector<CTestClient::Call> CTestClient::CallsOf(DISPID dispid) const
{
    CCritSecLock lock(m_pState->cs);
    std::vector<Call> result;
    for (const Call& call : m_pState->calls) {
        if (call.dispid == dispid) result.push_back(call);
    }
    return result;
}

size_t CTestClient::CallCount(DISPID dispid) const
{
    return CallsOf(dispid).size();
}

void CTestClient::ClearCalls()
{
    CCritSecLock lock(m_pState->cs);
    m_pState->calls.clear();
}

ULONG CTestClient::RefCount() const noexcept
{
    return static_cast<ULONG>(::InterlockedCompareExchange(const_cast<LONG*>(&m_nRef), 0, 0));
}

LONG CTestClient::LiveObjects() noexcept
{
    return LiveCounter()->load();
}

STDMETHODIMP CTestClient::QueryInterface(REFIID riid, void** ppv)
{
    if (ppv == nullptr) return E_POINTER;
    *ppv = nullptr;
    if (!::IsEqualIID(riid, IID_IUnknown) && !::IsEqualIID(riid, IID_IDispatch)) return E_NOINTERFACE;
    *ppv = static_cast<IDispatch*>(this);
    AddRef();
    return S_OK;
}

STDMETHODIMP_(ULONG) CTestClient::AddRef()
{
    return static_cast<ULONG>(::InterlockedIncrement(&m_nRef));
}

STDMETHODIMP_(ULONG) CTestClient::Release()
{
    LONG nRef = ::InterlockedDecrement(&m_nRef);
    if (nRef == 0) delete this;
    return static_cast<ULONG>(nRef);
}

STDMETHODIMP CTestClient::GetTypeInfoCount(UINT*)
{
    return E_NOTIMPL;
}

STDMETHODIMP CTestClient::GetTypeInfo(UINT, LCID, ITypeInfo**)
{
    return E_NOTIMPL;
}

STDMETHODIMP CTestClient::GetIDsOfNames(REFIID, LPOLESTR*, UINT, LCID, DISPID*)
{
    return E_NOTIMPL;
}

STDMETHODIMP CTestClient::Invoke(DISPID dispid, REFIID riid, LCID lcid, WORD wFlags, DISPPARAMS* pParams,
                                 VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr)
{
    try {
        Call call;
        call.dispid = dispid;
        call.dwThreadId = ::GetCurrentThreadId();
        call.wFlags = wFlags;
        call.lcid = lcid;
        call.bRiidNull = ::IsEqualIID(riid, IID_NULL) != FALSE;
        call.bResultNull = pVarResult == nullptr;
        call.vtResultOnEntry = pVarResult != nullptr ? V_VT(pVarResult) : static_cast<VARTYPE>(VT_EMPTY);
        call.bExcepInfoNull = pExcepInfo == nullptr;
        call.bArgErrNull = puArgErr == nullptr;
        if (pParams != nullptr) {
            call.cArgs = pParams->cArgs;
            call.cNamedArgs = pParams->cNamedArgs;
            call.bRgvargNull = pParams->rgvarg == nullptr;
            call.bNamedArgsNull = pParams->rgdispidNamedArgs == nullptr;
            for (UINT i = 0; i < pParams->cArgs && pParams->rgvarg != nullptr; ++i) {
                call.args.push_back(RecordArg(pParams->rgvarg[i]));
            }
        }

        HRESULT hr = S_OK;
        Hook hook;
        {
            CCritSecLock lock(m_pState->cs);
            m_pState->calls.push_back(call);
            auto itResult = m_pState->results.find(dispid);
            if (itResult != m_pState->results.end()) hr = itResult->second;
            auto itHook = m_pState->hooks.find(dispid);
            if (itHook != m_pState->hooks.end()) hook = itHook->second;
            if (dispid == DISPID_GETUSERINPUT && pVarResult != nullptr && SUCCEEDED(hr)) {
                HRESULT hrCopy = ::VariantCopy(pVarResult, &m_pState->input);
                if (FAILED(hrCopy)) return hrCopy;
            }
        }
        if (hook) {
            HRESULT hrHook = hook(call);
            if (hrHook != S_FALSE) hr = hrHook;
        }
        return hr;
    } catch (...) {
        return HResultFromCurrentException();
    }
}
