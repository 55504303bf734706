#pragma once
// An in-process stand-in for the client: a COM object that answers
// IDispatch (and IUnknown) with the four client calls by dispatch id
// (1 Connect, 2 Print, 3 GetUserInput, 4 Detach). It records every call it
// receives (dispatch id, a deep copy of the arguments as received, the
// calling thread and the Invoke parameters), and returns results a test
// chooses beforehand. Its reference count can be read at any time.
//
// Usage:
//   CTestClient* pClient = CTestClient::Create();   // count 1, owned by you
//   pClient->SetResult(CTestClient::DISPID_PRINT, E_FAIL);
//   ... hand pClient (an IDispatch*) to the server ...
//   auto calls = pClient->Calls();                    // every call, in order
//   pClient->Release();
//
// A test may also run code inside a call (SetHook), e.g. to make a nested
// call back into the server the way a real client does while it handles
// Print, or to read the interpreter lock's owner while the callback runs.
// Thread-safe: calls may come from any thread.
#include <windows.h>
#include <oaidl.h>

#include <atomic>
#include <functional>
#include <string>
#include <vector>

class CTestClient final : public IDispatch
{
public:
    enum : DISPID
    {
        DISPID_CONNECT = 1,
        DISPID_PRINT = 2,
        DISPID_GETUSERINPUT = 3,
        DISPID_DETACH = 4,
    };

    // One recorded argument, converted at the time of the call.
    struct Arg
    {
        VARTYPE vt = VT_EMPTY;
        bool bNullBstr = false;     // VT_BSTR whose BSTR was null
        std::wstring strText;       // VT_BSTR content (length from SysStringLen)
        LONG nValue = 0;            // VT_BOOL / VT_I2 / VT_I4 value as received
        IDispatch* pDispatch = nullptr;  // VT_DISPATCH pointer (not kept alive)
    };

    // One recorded Invoke.
    struct Call
    {
        DISPID dispid = 0;
        DWORD dwThreadId = 0;
        WORD wFlags = 0;
        LCID lcid = 0;
        bool bRiidNull = false;         // riid was IID_NULL
        UINT cArgs = 0;
        UINT cNamedArgs = 0;
        bool bRgvargNull = false;
        bool bNamedArgsNull = false;
        bool bResultNull = false;       // pVarResult was null
        VARTYPE vtResultOnEntry = VT_EMPTY;  // type of *pVarResult on entry
        bool bExcepInfoNull = false;
        bool bArgErrNull = false;
        std::vector<Arg> args;          // rgvarg order: index 0 = last declared
    };

    // Runs inside Invoke, after the call was recorded and before the result is
    // returned. The returned HRESULT replaces the configured one when the hook
    // returns anything but S_FALSE.
    using Hook = std::function<HRESULT(const Call& call)>;

    // A new client with reference count 1 (the caller's). Null on OOM.
    static CTestClient* Create() noexcept;

    // The HRESULT Invoke returns for a dispatch id (default S_OK).
    void SetResult(DISPID dispid, HRESULT hr);
    // What GetUserInput stores in *pVarResult (copied; default: a BSTR "input").
    // Use VT_EMPTY to give no value.
    void SetInputResult(const VARIANT& var);
    void SetHook(DISPID dispid, Hook hook);

    std::vector<Call> Calls() const;
    std::vector<Call> CallsOf(DISPID dispid) const;
    size_t CallCount(DISPID dispid) const;
    void ClearCalls();

    // The current reference count (not counting this read).
    ULONG RefCount() const noexcept;
    // The number of objects of this class still alive in the process.
    static LONG LiveObjects() noexcept;

    // IUnknown
    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override;
    STDMETHOD_(ULONG, AddRef)() override;
    STDMETHOD_(ULONG, Release)() override;
    // IDispatch: only Invoke does anything; the other three answer E_NOTIMPL.
    STDMETHOD(GetTypeInfoCount)(UINT* pctinfo) override;
    STDMETHOD(GetTypeInfo)(UINT iTInfo, LCID lcid, ITypeInfo** ppTInfo) override;
    STDMETHOD(GetIDsOfNames)(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID lcid, DISPID* rgDispId) override;
    STDMETHOD(Invoke)(DISPID dispid, REFIID riid, LCID lcid, WORD wFlags, DISPPARAMS* pParams,
                      VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr) override;

private:
    CTestClient();
    ~CTestClient();
    struct State;
    State* m_pState;
    LONG m_nRef = 1;
};
