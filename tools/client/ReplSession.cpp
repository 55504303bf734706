#include "client/ReplSession.h"

#include "client/Marshal.h"
#include "client/MessagePump.h"

namespace {

constexpr DWORD kDestructorWaitMs = 5000;

}  // namespace

CReplSession::~CReplSession()
{
    if (!m_bStarted) return;
    // A host that is still running is given a moment to finish what it is
    // saying to us, then ended: a session object never outlives its host.
    if (!m_host.WaitForExit(kDestructorWaitMs)) {
        m_host.Kill();
        m_host.WaitForExit(kDestructorWaitMs);
    }
    if (m_spClient) m_spClient->DisconnectRemotes();
}

HRESULT CReplSession::Start(const SessionOptions& options, CReplClientObject* pClient)
{
    if (m_bStarted) return HRESULT_FROM_WIN32(ERROR_ALREADY_INITIALIZED);
    m_spClient = pClient ? CComPtr<CReplClientObject>(pClient) : CReplClientObject::Create();
    if (!m_spClient) return E_OUTOFMEMORY;
    HRESULT hr = m_pipe.Create();
    if (FAILED(hr)) return hr;
    m_strClientText = MarshalToBase64(m_spClient, &hr);
    if (FAILED(hr)) return hr;
    const std::string strText = options.strClientTextOverride.value_or(m_strClientText);
    m_strCommandLine = options.strHostCommand + L" " + QuoteArg(Utf8ToWide(strText)) + L" " +
                       std::to_wstring(::GetCurrentProcessId()) + L" " + m_pipe.ReadHandleText();
    if (!options.strExtraArgs.empty()) m_strCommandLine += L" " + options.strExtraArgs;
    HostOptions host = options.host;
    host.strCommandLine = m_strCommandLine;
    hr = m_host.Start(host);
    // The host has its own copy of the read end; without ours, writes fail
    // once the host is gone instead of filling the pipe.
    m_pipe.CloseRead();
    if (FAILED(hr)) {
        ReleaseMarshalText(m_strClientText);
        return hr;
    }
    m_bStarted = true;
    return S_OK;
}

bool CReplSession::WaitConnected(DWORD dwTimeoutMs)
{
    if (!m_bStarted) return false;
    HANDLE hWaits[] = {m_spClient->ConnectedEvent(), m_host.ProcessHandle()};
    PumpWaitAny(hWaits, 2, dwTimeoutMs);
    return m_spClient->IsConnected() || m_spClient->WasDetached();
}

std::optional<DWORD> CReplSession::Finish(DWORD dwTimeoutMs, CallResult* pQuit)
{
    if (!m_bStarted) return std::nullopt;
    {
        CComPtr<IDispatch> spServer = m_spClient->Server();
        if (spServer && !m_spClient->WasDetached()) {
            CallResult quit = CallQuit(spServer);
            if (pQuit) *pQuit = std::move(quit);
        }
    }
    // The server's last Release comes back to us: keep pumping to the end.
    std::optional<DWORD> dwExitCode = m_host.WaitForExit(dwTimeoutMs);
    if (dwExitCode) m_spClient->DisconnectRemotes();
    return dwExitCode;
}
