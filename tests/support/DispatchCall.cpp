#include "DispatchCall.h"

#include <vector>

#include "common/Raii.h"

DispatchOutcome::DispatchOutcome() noexcept
{
    ::VariantInit(&varResult);
    excepInfo = EXCEPINFO{};
}

DispatchOutcome::~DispatchOutcome()
{
    ::VariantClear(&varResult);
    ::SysFreeString(excepInfo.bstrSource);
    ::SysFreeString(excepInfo.bstrDescription);
    ::SysFreeString(excepInfo.bstrHelpFile);
}

std::wstring DispatchOutcome::Description() const
{
    if (excepInfo.bstrDescription == nullptr) return std::wstring();
    return std::wstring(excepInfo.bstrDescription, ::SysStringLen(excepInfo.bstrDescription));
}

std::wstring DispatchOutcome::ResultText() const
{
    if (V_VT(&varResult) != VT_BSTR || V_BSTR(&varResult) == nullptr) return std::wstring();
    return std::wstring(V_BSTR(&varResult), ::SysStringLen(V_BSTR(&varResult)));
}

DispatchArg::DispatchArg() noexcept
{
    ::VariantInit(&var);
}

DispatchArg::DispatchArg(DispatchArg&& other) noexcept : var(other.var)
{
    ::VariantInit(&other.var);
}

DispatchArg::~DispatchArg()
{
    ::VariantClear(&var);
}

DispatchArg DispatchArg::Bstr(const wchar_t* psz)
{
    DispatchArg arg;
    V_VT(&arg.var) = VT_BSTR;
    V_BSTR(&arg.var) = psz != nullptr ? ::SysAllocString(psz) : nullptr;
    if (psz != nullptr && V_BSTR(&arg.var) == nullptr) ThrowHResult(E_OUTOFMEMORY);
    return arg;
}

DispatchArg DispatchArg::I4(LONG n)
{
    DispatchArg arg;
    V_VT(&arg.var) = VT_I4;
    V_I4(&arg.var) = n;
    return arg;
}

DispatchArg DispatchArg::Empty()
{
    return DispatchArg();
}

DispatchArg DispatchArg::Of(const VARIANT& var)
{
    DispatchArg arg;
    HRESULT hr = ::VariantCopy(&arg.var, const_cast<VARIANT*>(&var));
    if (FAILED(hr)) ThrowHResult(hr);
    return arg;
}

void InvokeMethod(IDispatch* pDispatch, DISPID dispid, std::initializer_list<const DispatchArg*> args,
                  DispatchOutcome& outcome)
{
    // rgvarg holds the last declared argument first; the callee must not own them.
    std::vector<VARIANT> rgvarg;
    for (auto it = args.end(); it != args.begin();) {
        --it;
        rgvarg.push_back((*it)->var);
    }
    DISPPARAMS params = {rgvarg.empty() ? nullptr : rgvarg.data(), nullptr, static_cast<UINT>(rgvarg.size()), 0};
    outcome.hr = pDispatch->Invoke(dispid, IID_NULL, LOCALE_USER_DEFAULT, DISPATCH_METHOD, &params,
                                   &outcome.varResult, &outcome.excepInfo, &outcome.uArgErr);
}
