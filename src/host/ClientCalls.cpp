// The server object's two calls on the client for the bridge: Print and
// GetUserInput, late bound through the client's IDispatch.
#include <windows.h>
#include <oleauto.h>

#include "host/RunState.h"
#include "server/ReplServerImpl.h"

namespace {

constexpr DISPID kDispidPrint = 2;
constexpr DISPID kDispidGetUserInput = 3;
// The one result of a client call that means the client process is gone.
constexpr HRESULT kClientUnavailable = static_cast<HRESULT>(0x800706BA);

static_assert(sizeof(CComVariant) == sizeof(VARIANT), "argument arrays are passed as VARIANT arrays");

HRESULT InvokeClient(IDispatch* pClient, DISPID dispid, CComVariant* pArgs, UINT cArgs, VARIANT* pResult) noexcept
{
    DISPPARAMS params{pArgs, nullptr, cArgs, 0};
    return pClient->Invoke(dispid, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params, pResult, nullptr,
                           nullptr);
}

}  // namespace

void KxCIReplServerImpl::PrintToClient(LPCWSTR pszText, bool bIsError)
{
    // Own references for the length of the call: while it waits, the
    // client may call Quit, which releases both the client and the run's
    // reference to this object.
    CComPtr<IReplServer> spSelf(static_cast<IReplServer*>(this));
    CComPtr<IDispatch> spClient(m_spClient);
    if (!spClient) {
        return;
    }
    CComVariant rgArgs[2];  // in IDispatch order: the last parameter first
    rgArgs[0].vt = VT_BOOL;
    rgArgs[0].boolVal = bIsError ? VARIANT_TRUE : VARIANT_FALSE;
    rgArgs[1].bstrVal = ::SysAllocString(pszText);
    if (rgArgs[1].bstrVal == nullptr) {
        LogErrorNoThrow("Cannot copy text for client call of Print, dropped");
        return;
    }
    rgArgs[1].vt = VT_BSTR;
    HRESULT hr = InvokeClient(spClient, kDispidPrint, rgArgs, 2, nullptr);
    if (hr == kClientUnavailable) {
        LogErrorNoThrow("Client is unavailable, quitting");
        Quit();
    } else if (FAILED(hr)) {
        m_hrLastPrintError = hr;
        LogErrorNoThrow("Client call of Print failed");
    }
}

void KxCIReplServerImpl::GetInputFromClient(LPCWSTR pszPrompt, BSTR* pRes)
{
    CComPtr<IReplServer> spSelf(static_cast<IReplServer*>(this));
    CComPtr<IDispatch> spClient(m_spClient);
    if (!spClient) {
        return;
    }
    CComVariant rgArgs[1];
    rgArgs[0].vt = VT_BSTR;
    rgArgs[0].bstrVal = ::SysAllocString(pszPrompt);  // a null prompt stays a null BSTR
    if (pszPrompt != nullptr && rgArgs[0].bstrVal == nullptr) {
        // Asking without the prompt still lets the user answer.
        LogErrorNoThrow("Cannot copy prompt for client call of GetUserInput, asking without it");
    }
    CComVariant varResult;
    HRESULT hr = InvokeClient(spClient, kDispidGetUserInput, rgArgs, 1, &varResult);
    if (hr == kClientUnavailable) {
        LogErrorNoThrow("Client is unavailable, quitting");
        Quit();
    } else if (FAILED(hr)) {
        LogErrorNoThrow("Client call of GetUserInput failed");
    } else if (varResult.vt == VT_BSTR) {
        *pRes = varResult.bstrVal;  // the caller owns the answer now
        varResult.vt = VT_EMPTY;
    }
}
