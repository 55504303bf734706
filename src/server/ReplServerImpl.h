#pragma once
// The server object: the automation object the client drives. It executes
// each command through one of the two callbacks the Python side handed to
// KxReplRun, and it holds the client through which output and input flow.
#include <windows.h>
#include <oleauto.h>

#include "ReplServer_h.h"
#include "common/Raii.h"
#include "host/KxRepl.h"
#include "python/PythonFunctions.h"
#include "server/AtlBase.h"

class KxCIReplServerImpl
    : public CComObjectRootEx<CComSingleThreadModel>,
      public CComCoClass<KxCIReplServerImpl, &CLSID_ReplServer>,
      public IDispatchImpl<IReplServer, &IID_IReplServer, &LIBID_ReplServerLib, 0xFFFF, 0xFFFF, CComTypeInfoHolder>,
      public ISupportErrorInfoImpl<&IID_IReplServer>
{
public:
    // Connects the client; on success the object is g_pCurrentServer and
    // holds a reference of its own.
    HRESULT Init(IDispatch* pClient, HMODULE hPythonDLL, HMODULE hPythonComDLL, ExecProc pExecProc,
                 ExecComProc pExecComProc);

    // IReplServer
    STDMETHOD(Exec)(BSTR Command, BSTR Argument, BSTR* pResult) override;
    STDMETHOD(ExecCom)(BSTR Command, VARIANT Argument, VARIANT* pResult) override;
    STDMETHOD(Quit)() override;

    // Calls on the client made by the output and input bridge (main thread).
    void PrintToClient(LPCWSTR pszText, bool bIsError);
    void GetInputFromClient(LPCWSTR pszPrompt, BSTR* pRes);

    // The command bracket.
    void BeginExec() noexcept;
    bool EndExec() noexcept;
    PyObject* PyObjectFromVariantLocked(VARIANT* pVar) noexcept;

    // Called by destruction before the module is unlocked.
    void FinalRelease() noexcept;

    // The interface table: IReplServer and IDispatch on the primary face,
    // ISupportErrorInfo on the second.
    static const InterfaceMapEntry<KxCIReplServerImpl>* _GetEntries() noexcept;

    CComPtr<IDispatch> m_spClient;
    ExecProc m_pExecProc = nullptr;
    ExecComProc m_pExecComProc = nullptr;
    HRESULT m_hrLastPrintError = S_OK;
    PythonFunctions m_python;
    // The runtime module of the run, for a deferred interrupt when the
    // table could not be bound.
    HMODULE m_hPythonDLL = nullptr;
    // The reference Init took for g_pCurrentServer is still held; only the
    // Quit that gives it back ends the run.
    bool m_bHoldsRunReference = false;

private:
    HRESULT ConnectClient() noexcept;
    // The bodies of Exec and ExecCom; bReported is set when they installed
    // an error object.
    HRESULT ExecText(BSTR Command, BSTR Argument, BSTR* pResult, bool& bReported);
    HRESULT ExecVariant(BSTR Command, VARIANT* pArgument, VARIANT* pResult, bool& bReported);
    HRESULT FinishExecCom(int nRc, bool bInterrupted, PyObject* pyResult, VARIANT* pResult,
                          bool& bReported) noexcept;
    void RaiseDeferredInterrupt() noexcept;
    IReplServer* PrimaryFace() noexcept { return this; }
};

typedef CComObject<KxCIReplServerImpl> CReplServerObject;

// Makes a server object with reference count 0 (the caller AddRefs first).
HRESULT CreateServerObject(CComObject<KxCIReplServerImpl>** ppObject) noexcept;

// The object of the current server run, or null. Main thread only.
extern CComObject<KxCIReplServerImpl>* g_pCurrentServer;
