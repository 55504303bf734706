#pragma once
// CReplClientObject: the client's side of the automation contract, an
// IDispatch that answers the four calls a ReplServer makes on its client
// (dispatch ids 1 Connect, 2 Print, 3 GetUserInput, 4 Detach, also found by
// name through GetIDsOfNames, case-insensitively).
//
// It records every call in arrival order, keeps the server's IDispatch from
// Connect (its own reference, released on Detach), answers input prompts from
// a queue, fails calls on request, and tells observers as calls arrive.
// Every member is thread-safe; handlers and the hook run on the thread that
// delivered the call, outside the object's lock, so they may call back into
// the server (a nested call) or into this object.
//
// Cross-process calls arrive as window messages on the thread (a
// single-threaded apartment) that marshalled the object: that thread must
// keep pumping messages (see MessagePump.h) for calls to get through.
//
//   CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
//   spClient->QueueInput(CInputAnswer::Text(L"42"));
//   spClient->SetPrintHandler([](const std::wstring& str, bool bErr) { ... });
//   ... MarshalToBase64(spClient) ... start the host ...
//   PumpWait(spClient->ConnectedEvent(), 10000);
//   CComPtr<IDispatch> spServer = spClient->Server();
#include <windows.h>
#include <oaidl.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "ReplServer_h.h"
#include "common/Raii.h"

// What GetUserInput answers. Copyable; the default is NoInput().
class CInputAnswer
{
public:
    // S_OK with a VT_BSTR result holding the text (an empty text is an
    // empty BSTR, which is input, unlike NoInput).
    static CInputAnswer Text(const std::wstring& strText);
    // S_OK with the result left VT_EMPTY: the server reads it as "no input".
    static CInputAnswer NoInput();
    // The given failure HRESULT; the result is left untouched.
    static CInputAnswer Failure(HRESULT hr);
    // S_OK with a copy of any VARIANT (e.g. VT_I4, which is not input).
    static CInputAnswer Value(const VARIANT& var);

    CInputAnswer();
    // Fills *pvarResult (when not null) and gives the HRESULT to return.
    HRESULT Answer(VARIANT* pvarResult) const noexcept;
    HRESULT Result() const noexcept { return m_hr; }
    // The answer's text when it is a VT_BSTR answer; otherwise empty.
    std::wstring TextOrEmpty() const;

private:
    HRESULT m_hr = S_OK;
    std::shared_ptr<const CComVariant> m_spValue;  // null: VT_EMPTY
};

class CReplClientObject final : public IReplClient
{
public:
    enum : DISPID
    {
        DISPID_CONNECT = 1,
        DISPID_PRINT = 2,
        DISPID_GETUSERINPUT = 3,
        DISPID_DETACH = 4,
    };

    // One call as the object received it.
    struct Call
    {
        size_t nSequence = 0;       // 1 for the first call the object received
        DISPID dispid = 0;          // one of the DISPID_ values above
        DWORD dwThreadId = 0;       // thread that delivered the call
        std::wstring strText;       // Print: the text; GetUserInput: the prompt
        bool bNullText = false;     // that BSTR was null
        bool bIsError = false;      // Print: bIsError was not VARIANT_FALSE
        VARIANT_BOOL nIsError = 0;  // Print: bIsError exactly as received
        WORD wFlags = 0;            // Invoke's wFlags
        UINT cArgs = 0;             // number of arguments received
        HRESULT hrAnswer = S_OK;    // what the object returned
        std::wstring strAnswer;     // GetUserInput: the text answered, if any
    };

    // Handlers, each called on the delivering thread after the call was
    // recorded, outside the object's lock.
    using PrintHandler = std::function<void(const std::wstring& strText, bool bIsError)>;
    // Asked for an answer when the input queue is empty; without it the
    // default answer (SetDefaultInput) is given.
    using InputHandler = std::function<CInputAnswer(const std::wstring& strPrompt)>;
    // Runs inside every call before the call takes effect (in Connect,
    // before the server is kept); a value replaces the configured HRESULT,
    // and a failure means the call has no effect (a failed Detach still
    // lets the server go).
    using CallHook = std::function<std::optional<HRESULT>(const Call& call)>;

    // A new object; the returned pointer holds the only reference.
    // Null only when memory is exhausted.
    static CComPtr<CReplClientObject> Create() noexcept;

    // ---- configuration -------------------------------------------------------
    // Calls of dispid from number nFromCall on (1 = the first such call)
    // return hr. A failed call is still recorded but has no effect: Print
    // shows nothing, Connect keeps no server, GetUserInput takes no answer
    // (Detach lets the server go all the same). S_OK restores success.
    void SetResult(DISPID dispid, HRESULT hr, size_t nFromCall = 1);
    // Answers for the coming GetUserInput calls, first in first out.
    void QueueInput(const CInputAnswer& answer);
    void SetDefaultInput(const CInputAnswer& answer);
    void SetPrintHandler(PrintHandler fnHandler);
    void SetInputHandler(InputHandler fnHandler);
    void SetCallHook(CallHook fnHook);
    // Whether calls are kept for Calls() (default true). A long-running
    // console turns it off; counters, events and handlers work either way.
    void SetRecording(bool bRecord);

    // ---- observation ---------------------------------------------------------
    std::vector<Call> Calls() const;
    std::vector<Call> CallsOf(DISPID dispid) const;
    size_t CountOf(DISPID dispid) const;
    // The texts of all Print calls of one kind, joined in order.
    std::wstring Output(bool bIsError) const;
    // Forgets the recorded calls (events and the server are kept).
    void ClearCalls();
    // Every call received since the object was made, recorded or not.
    size_t CallCount() const;

    // The server from the last successful Connect; null before it and after
    // Detach.
    CComPtr<IDispatch> Server() const;
    // Manual-reset events owned by the object: set by the first successful
    // Connect, by the first Detach, and once n Print calls have arrived
    // (failed ones too; counted since the object's creation, whatever
    // ClearCalls forgot). A print-count event is made on first request.
    HANDLE ConnectedEvent() const noexcept { return m_hConnected.Get(); }
    HANDLE DetachedEvent() const noexcept { return m_hDetached.Get(); }
    HANDLE PrintCountEvent(size_t nPrints);
    bool IsConnected() const;  // a server is held
    bool WasDetached() const;

    // The current reference count (not counting the read itself).
    ULONG RefCount() const noexcept;
    // Drops every reference that other apartments and processes hold on the
    // object (CoDisconnectObject), e.g. a marshalled text never unmarshalled.
    void DisconnectRemotes() noexcept;

    // ---- IUnknown, IDispatch, IReplClient ------------------------------------
    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override;
    STDMETHOD_(ULONG, AddRef)() override;
    STDMETHOD_(ULONG, Release)() override;
    // No type information: GetTypeInfoCount answers 0.
    STDMETHOD(GetTypeInfoCount)(UINT* pctinfo) override;
    STDMETHOD(GetTypeInfo)(UINT iTInfo, LCID lcid, ITypeInfo** ppTInfo) override;
    STDMETHOD(GetIDsOfNames)(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID lcid, DISPID* rgDispId) override;
    STDMETHOD(Invoke)(DISPID dispid, REFIID riid, LCID lcid, WORD wFlags, DISPPARAMS* pParams,
                      VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr) override;
    STDMETHOD(Connect)(IDispatch* pServer) override;
    STDMETHOD(Print)(BSTR Text, VARIANT_BOOL bIsError) override;
    STDMETHOD(GetUserInput)(BSTR Prompt, BSTR* pRes) override;
    STDMETHOD(Detach)() override;

private:
    CReplClientObject();
    ~CReplClientObject();

    struct State;
    HRESULT Dispatch(Call& call, IDispatch* pServer, VARIANT* pVarResult) noexcept;
    size_t Arrive(Call& call);
    HRESULT Perform(Call& call, HRESULT hr, IDispatch* pServer, VARIANT* pVarResult);
    void Complete(const Call& call);
    HRESULT HandleConnect(IDispatch* pServer);
    HRESULT HandlePrint(const Call& call);
    HRESULT HandleInput(Call& call, VARIANT* pVarResult);
    HRESULT HandleDetach();
    HRESULT ConfiguredResult(DISPID dispid, size_t nCall) const;
    HRESULT RunHook(const Call& call, HRESULT hr);

    std::unique_ptr<State> m_pState;
    CHandle m_hConnected;
    CHandle m_hDetached;
    LONG m_nRef = 0;
};
