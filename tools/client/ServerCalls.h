#pragma once
// Calling a ReplServer the way a late-bound client does: IDispatch::Invoke
// with DISPATCH_METHOD, the arguments in reverse order of declaration, a
// result VARIANT and an EXCEPINFO that is read back.
//
// A method's own failure comes back as DISP_E_EXCEPTION with the method's
// HRESULT in EXCEPINFO.scode (E_ABORT for an interrupted command,
// DISP_E_EXCEPTION for a failed one) and the failure text in the
// description; Effective() folds that into one code.
#include <windows.h>
#include <oaidl.h>

#include <initializer_list>
#include <string>

#include "common/Raii.h"

enum : DISPID
{
    DISPID_REPL_EXEC = 1,
    DISPID_REPL_EXECCOM = 2,
    DISPID_REPL_QUIT = 3,
};

struct CallResult
{
    CallResult() = default;
    CallResult(CallResult&& other) noexcept;
    CallResult& operator=(CallResult&& other) noexcept;
    CallResult(const CallResult&) = delete;
    CallResult& operator=(const CallResult&) = delete;

    HRESULT hr = E_UNEXPECTED;   // what Invoke (or GetIDsOfNames) returned
    CComVariant varResult;       // the result VARIANT
    bool bHasExcepInfo = false;  // hr was DISP_E_EXCEPTION
    HRESULT hrScode = S_OK;      // EXCEPINFO.scode (or wCode as an HRESULT)
    bool bNullDescription = true;
    std::wstring strDescription; // EXCEPINFO.bstrDescription
    std::wstring strSource;      // EXCEPINFO.bstrSource
    UINT uArgErr = 0;

    // hrScode after DISP_E_EXCEPTION, otherwise hr.
    HRESULT Effective() const noexcept;
    bool Succeeded() const noexcept { return SUCCEEDED(hr); }
    // The result's text when it is VT_BSTR (a null BSTR gives ""); else "".
    std::wstring Text() const;
};

// Resolves one method name (GetIDsOfNames, IID_NULL, LOCALE_USER_DEFAULT).
HRESULT GetDispId(IDispatch* pDispatch, const wchar_t* pszName, DISPID* pDispId);

// Invoke by dispatch id. vecArgs are in declared order and stay the caller's.
CallResult InvokeById(IDispatch* pDispatch, DISPID dispid, std::initializer_list<VARIANT> vecArgs = {});
// The same after GetIDsOfNames; a failed lookup is returned in hr.
CallResult InvokeByName(IDispatch* pDispatch, const wchar_t* pszName, std::initializer_list<VARIANT> vecArgs = {});

// The three server methods; bByName resolves the name first.
CallResult CallExec(IDispatch* pServer, const std::wstring& strCommand, const std::wstring& strArgument,
                    bool bByName = false);
CallResult CallExecCom(IDispatch* pServer, const std::wstring& strCommand, const VARIANT& varArgument,
                       bool bByName = false);
CallResult CallQuit(IDispatch* pServer, bool bByName = false);

// "0x80004004 (E_ABORT)"-style text for logs and consoles.
std::wstring DescribeHResult(HRESULT hr);
