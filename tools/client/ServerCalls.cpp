#include "client/ServerCalls.h"

#include <cstdio>
#include <vector>

namespace {

std::wstring BstrText(BSTR bstr)
{
    return bstr ? std::wstring(bstr, ::SysStringLen(bstr)) : std::wstring();
}

// Takes what an EXCEPINFO holds into the result and frees its strings.
void TakeExcepInfo(EXCEPINFO& ei, CallResult& result)
{
    if (ei.pfnDeferredFillIn != nullptr) ei.pfnDeferredFillIn(&ei);
    result.bHasExcepInfo = true;
    result.hrScode = ei.scode != 0 ? ei.scode : (ei.wCode != 0 ? MAKE_HRESULT(1, FACILITY_ITF, ei.wCode) : S_OK);
    result.bNullDescription = ei.bstrDescription == nullptr;
    result.strDescription = BstrText(ei.bstrDescription);
    result.strSource = BstrText(ei.bstrSource);
    ::SysFreeString(ei.bstrDescription);
    ::SysFreeString(ei.bstrSource);
    ::SysFreeString(ei.bstrHelpFile);
}

// A VT_BSTR VARIANT over a BSTR that the caller owns.
VARIANT BstrArg(BSTR bstr)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = bstr;
    return var;
}

CallResult Call(IDispatch* pServer, DISPID dispid, const wchar_t* pszName, bool bByName,
                std::initializer_list<VARIANT> vecArgs)
{
    return bByName ? InvokeByName(pServer, pszName, vecArgs) : InvokeById(pServer, dispid, vecArgs);
}

}  // namespace

CallResult::CallResult(CallResult&& other) noexcept
{
    *this = std::move(other);
}

CallResult& CallResult::operator=(CallResult&& other) noexcept
{
    if (this == &other) return *this;
    hr = other.hr;
    ::VariantClear(&varResult);
    // A VARIANT moves by its bits; the source is left empty.
    static_cast<VARIANT&>(varResult) = static_cast<VARIANT&>(other.varResult);
    ::VariantInit(&other.varResult);
    bHasExcepInfo = other.bHasExcepInfo;
    hrScode = other.hrScode;
    bNullDescription = other.bNullDescription;
    strDescription = std::move(other.strDescription);
    strSource = std::move(other.strSource);
    uArgErr = other.uArgErr;
    return *this;
}

HRESULT CallResult::Effective() const noexcept
{
    return hr == DISP_E_EXCEPTION && bHasExcepInfo ? hrScode : hr;
}

std::wstring CallResult::Text() const
{
    return V_VT(&varResult) == VT_BSTR ? BstrText(V_BSTR(&varResult)) : std::wstring();
}

HRESULT GetDispId(IDispatch* pDispatch, const wchar_t* pszName, DISPID* pDispId)
{
    if (pDispatch == nullptr || pszName == nullptr || pDispId == nullptr) return E_POINTER;
    LPOLESTR pszNames[] = {const_cast<LPOLESTR>(pszName)};
    return pDispatch->GetIDsOfNames(IID_NULL, pszNames, 1, LOCALE_USER_DEFAULT, pDispId);
}

CallResult InvokeById(IDispatch* pDispatch, DISPID dispid, std::initializer_list<VARIANT> vecArgs)
{
    CallResult result;
    if (pDispatch == nullptr) {
        result.hr = E_POINTER;
        return result;
    }
    // Invoke wants the last declared argument first.
    std::vector<VARIANT> vecReversed(vecArgs.begin(), vecArgs.end());
    std::vector<VARIANT>(vecReversed.rbegin(), vecReversed.rend()).swap(vecReversed);
    DISPPARAMS params = {vecReversed.empty() ? nullptr : vecReversed.data(), nullptr,
                         static_cast<UINT>(vecReversed.size()), 0};
    EXCEPINFO ei = {};
    result.hr = pDispatch->Invoke(dispid, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params,
                                  &result.varResult, &ei, &result.uArgErr);
    if (result.hr == DISP_E_EXCEPTION) {
        TakeExcepInfo(ei, result);
    } else {
        ::SysFreeString(ei.bstrDescription);
        ::SysFreeString(ei.bstrSource);
        ::SysFreeString(ei.bstrHelpFile);
    }
    return result;
}

CallResult InvokeByName(IDispatch* pDispatch, const wchar_t* pszName, std::initializer_list<VARIANT> vecArgs)
{
    DISPID dispid = DISPID_UNKNOWN;
    HRESULT hr = GetDispId(pDispatch, pszName, &dispid);
    if (FAILED(hr)) {
        CallResult result;
        result.hr = hr;
        return result;
    }
    return InvokeById(pDispatch, dispid, vecArgs);
}

CallResult CallExec(IDispatch* pServer, const std::wstring& strCommand, const std::wstring& strArgument,
                    bool bByName)
{
    CComBSTR bstrCommand(strCommand.c_str()), bstrArgument(strArgument.c_str());
    return Call(pServer, DISPID_REPL_EXEC, L"Exec", bByName, {BstrArg(bstrCommand), BstrArg(bstrArgument)});
}

CallResult CallExecCom(IDispatch* pServer, const std::wstring& strCommand, const VARIANT& varArgument,
                       bool bByName)
{
    CComBSTR bstrCommand(strCommand.c_str());
    return Call(pServer, DISPID_REPL_EXECCOM, L"ExecCom", bByName, {BstrArg(bstrCommand), varArgument});
}

CallResult CallQuit(IDispatch* pServer, bool bByName)
{
    return Call(pServer, DISPID_REPL_QUIT, L"Quit", bByName, {});
}

std::wstring DescribeHResult(HRESULT hr)
{
    struct Known
    {
        HRESULT hr;
        const wchar_t* pszName;
    };
    static const Known kKnown[] = {
        {S_OK, L"S_OK"},
        {S_FALSE, L"S_FALSE"},
        {E_NOTIMPL, L"E_NOTIMPL"},
        {E_NOINTERFACE, L"E_NOINTERFACE"},
        {E_POINTER, L"E_POINTER"},
        {E_ABORT, L"E_ABORT"},
        {E_FAIL, L"E_FAIL"},
        {E_INVALIDARG, L"E_INVALIDARG"},
        {E_OUTOFMEMORY, L"E_OUTOFMEMORY"},
        {DISP_E_EXCEPTION, L"DISP_E_EXCEPTION"},
        {DISP_E_BADINDEX, L"DISP_E_BADINDEX"},
        {DISP_E_MEMBERNOTFOUND, L"DISP_E_MEMBERNOTFOUND"},
        {DISP_E_UNKNOWNNAME, L"DISP_E_UNKNOWNNAME"},
        {DISP_E_BADPARAMCOUNT, L"DISP_E_BADPARAMCOUNT"},
        {DISP_E_TYPEMISMATCH, L"DISP_E_TYPEMISMATCH"},
        {RPC_E_DISCONNECTED, L"RPC_E_DISCONNECTED"},
        {HRESULT_FROM_WIN32(RPC_S_SERVER_UNAVAILABLE), L"RPC server unavailable"},
        {HRESULT_FROM_WIN32(RPC_S_CALL_FAILED), L"RPC call failed"},
    };
    wchar_t szCode[16];
    std::swprintf(szCode, 16, L"0x%08lX", static_cast<unsigned long>(hr));
    for (const Known& known : kKnown) {
        if (known.hr == hr) return std::wstring(szCode) + L" (" + known.pszName + L")";
    }
    return szCode;
}
