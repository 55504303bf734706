#pragma once
// Calls an IDispatch method the way a late-bound client does: DISPATCH_METHOD,
// the arguments in rgvarg in reverse order of declaration, a result VARIANT
// and an EXCEPINFO that the caller reads afterwards.
#include <windows.h>
#include <oaidl.h>

#include <initializer_list>
#include <string>

// The outcome of one Invoke. Owns the result VARIANT and the EXCEPINFO strings.
struct DispatchOutcome
{
    DispatchOutcome() noexcept;
    ~DispatchOutcome();
    DispatchOutcome(const DispatchOutcome&) = delete;
    DispatchOutcome& operator=(const DispatchOutcome&) = delete;

    HRESULT hr = E_UNEXPECTED;
    VARIANT varResult;
    EXCEPINFO excepInfo;
    UINT uArgErr = 0;

    // EXCEPINFO.bstrDescription as text ("" when null) and whether it was null.
    std::wstring Description() const;
    bool HasDescription() const noexcept { return excepInfo.bstrDescription != nullptr; }
    // The result's text when it is VT_BSTR.
    std::wstring ResultText() const;
};

// A VARIANT argument that owns its content.
struct DispatchArg
{
    VARIANT var;
    static DispatchArg Bstr(const wchar_t* psz);  // null gives a VT_BSTR holding null
    static DispatchArg I4(LONG n);
    static DispatchArg Empty();
    static DispatchArg Of(const VARIANT& var);  // deep copy
    DispatchArg(DispatchArg&& other) noexcept;
    DispatchArg(const DispatchArg&) = delete;
    DispatchArg& operator=(const DispatchArg&) = delete;
    ~DispatchArg();

private:
    DispatchArg() noexcept;
};

// Invoke(dispid, DISPATCH_METHOD) with args given in declared order; fills outcome.
void InvokeMethod(IDispatch* pDispatch, DISPID dispid, std::initializer_list<const DispatchArg*> args,
                  DispatchOutcome& outcome);
