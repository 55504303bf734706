#pragma once
// CReplSession: one client session with a host process, the way every
// client starts and ends one:
//
//   Start      makes the client object and the interrupt pipe, marshals the
//              client, and starts "<host command line> <client-text>
//              <client-pid> <pipe-handle> [extra args]";
//   WaitConnected  pumps until the server called Connect (or the host died);
//   ...        Exec/ExecCom on Server(), Pipe().Send('a'), ...;
//   Finish     calls Quit unless the server already detached, then pumps
//              until the host has exited (the server's last Release calls
//              back into the client), and drops what is left of the
//              client's remote references.
//
// Use it on one thread that has entered a single-threaded apartment
// (CoInitializeEx(COINIT_APARTMENTTHREADED)); that thread serves the host's
// calls while it waits in any of these functions.
#include <windows.h>

#include <optional>
#include <string>

#include "client/ClientObject.h"
#include "client/HostProcess.h"
#include "client/InterruptPipe.h"
#include "client/ServerCalls.h"

struct SessionOptions
{
    // Host command line before the three session arguments (program first,
    // already quoted), e.g. QuoteArg(ProgramDirectory() + L"\\repl_testhost.exe").
    std::wstring strHostCommand;
    // Appended after the session arguments (already quoted), e.g. L"--runs 2".
    std::wstring strExtraArgs;
    // The rest of HostOptions (bDebug, bCaptureOutput, callbacks...);
    // its strCommandLine is ignored.
    HostOptions host;
    // Replaces the client text on the command line (tests of bad texts).
    std::optional<std::string> strClientTextOverride;
};

class CReplSession
{
public:
    CReplSession() = default;
    ~CReplSession();  // pumps until a still running host exits (bounded), detaches
    CReplSession(const CReplSession&) = delete;
    CReplSession& operator=(const CReplSession&) = delete;

    // Creates the client object (configure it through Client() afterwards, or
    // before Start by passing your own), the pipe, the text, and starts the host.
    HRESULT Start(const SessionOptions& options, CReplClientObject* pClient = nullptr);
    // Pumps until Connect arrived (true) or the host exited or time ran out.
    bool WaitConnected(DWORD dwTimeoutMs);

    CReplClientObject& Client() const noexcept { return *m_spClient; }
    CInterruptPipe& Pipe() noexcept { return m_pipe; }
    CHostProcess& Host() noexcept { return m_host; }
    CComPtr<IDispatch> Server() const { return m_spClient ? m_spClient->Server() : CComPtr<IDispatch>(); }
    const std::string& ClientText() const noexcept { return m_strClientText; }
    const std::wstring& CommandLine() const noexcept { return m_strCommandLine; }

    // Ends the session: Quit when still connected (its outcome in *pQuit when
    // given), then pumps until the host has exited; gives the host's exit code,
    // or nothing when it did not exit within the timeout.
    std::optional<DWORD> Finish(DWORD dwTimeoutMs, CallResult* pQuit = nullptr);

private:
    CComPtr<CReplClientObject> m_spClient;
    CInterruptPipe m_pipe;
    CHostProcess m_host;
    std::string m_strClientText;
    std::wstring m_strCommandLine;
    bool m_bStarted = false;
};
