// replconsole: the reference console client of ReplServer. It starts a host
// process, attaches to the server in it over COM, and runs commands typed
// at its prompt or read from a script. See README.md for the flags and the
// line syntax.
#include <windows.h>
#include <process.h>
#include <shellapi.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "ConsoleIo.h"
#include "Script.h"
#include "client/ReplClient.h"

namespace {

constexpr int kExitClean = 0;
constexpr int kExitUsage = 1;
constexpr int kExitNoSession = 2;
constexpr int kExitUnclean = 3;
constexpr wchar_t kPrompt[] = L">>> ";
constexpr DWORD kQuietMs = 50;        // no call for this long: output has settled
constexpr DWORD kSettleMaxMs = 2000;  // output that streams on is shown later

struct ConsoleOptions
{
    std::wstring strHost;       // empty: the test host next to us
    std::wstring strHostArgs;
    std::wstring strScript;
    bool bLog = false;
    ColorMode color = ColorMode::Auto;
    DWORD dwTimeoutMs = 30000;
};

const CInterruptPipe* g_pPipe = nullptr;  // for the Ctrl+C handler

// Ctrl+C interrupts the running command, Ctrl+Break every Python thread;
// neither ends the console.
BOOL WINAPI CtrlHandler(DWORD dwCtrlType)
{
    if (dwCtrlType != CTRL_C_EVENT && dwCtrlType != CTRL_BREAK_EVENT) return FALSE;
    if (g_pPipe) g_pPipe->Send(dwCtrlType == CTRL_C_EVENT ? CInterruptPipe::kInterrupt : CInterruptPipe::kInterruptAll);
    return TRUE;
}

// Sends an interrupt after a delay unless cancelled first.
class CDelayedInterrupt
{
public:
    CDelayedInterrupt(const CInterruptPipe& pipe, DWORD dwMs, char chCommand)
        : m_pipe(pipe), m_dwMs(dwMs), m_chCommand(chCommand), m_hCancel(::CreateEventW(nullptr, TRUE, FALSE, nullptr))
    {
        m_hThread.Reset(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, ThreadProc, this, 0, nullptr)));
    }
    ~CDelayedInterrupt()
    {
        ::SetEvent(m_hCancel.Get());
        if (m_hThread) ::WaitForSingleObject(m_hThread.Get(), INFINITE);
    }
    CDelayedInterrupt(const CDelayedInterrupt&) = delete;
    CDelayedInterrupt& operator=(const CDelayedInterrupt&) = delete;

private:
    static unsigned __stdcall ThreadProc(void* pvParam)
    {
        auto* pThis = static_cast<CDelayedInterrupt*>(pvParam);
        if (::WaitForSingleObject(pThis->m_hCancel.Get(), pThis->m_dwMs) == WAIT_TIMEOUT) {
            pThis->m_pipe.Send(pThis->m_chCommand);
        }
        return 0;
    }

    const CInterruptPipe& m_pipe;
    DWORD m_dwMs;
    char m_chCommand;
    CHandle m_hCancel;
    CHandle m_hThread;
};

int Usage(const wchar_t* pszProblem)
{
    if (pszProblem) std::fwprintf(stderr, L"replconsole: %ls\n", pszProblem);
    std::fputws(L"usage: replconsole [--host \"<command line>\"] [--host-args \"<arguments>\"]\n"
                L"                   [--script <file>] [--log] [--no-color | --color] [--timeout <ms>]\n",
                stderr);
    return kExitUsage;
}

bool ParseOptions(ConsoleOptions& options, std::wstring& strProblem)
{
    int argc = 0;
    LPWSTR* argv = ::CommandLineToArgvW(::GetCommandLineW(), &argc);
    if (argv == nullptr) return false;
    std::vector<std::wstring> vecArgs(argv + 1, argv + argc);
    ::LocalFree(argv);
    for (size_t i = 0; i < vecArgs.size(); ++i) {
        const std::wstring& strOption = vecArgs[i];
        bool bHasValue = i + 1 < vecArgs.size();
        if (strOption == L"--log") options.bLog = true;
        else if (strOption == L"--no-color") options.color = ColorMode::Never;
        else if (strOption == L"--color") options.color = ColorMode::Always;
        else if (strOption == L"--host" && bHasValue) options.strHost = vecArgs[++i];
        else if (strOption == L"--host-args" && bHasValue) options.strHostArgs = vecArgs[++i];
        else if (strOption == L"--script" && bHasValue) options.strScript = vecArgs[++i];
        else if (strOption == L"--timeout" && bHasValue) options.dwTimeoutMs = std::wcstoul(vecArgs[++i].c_str(), nullptr, 10);
        else {
            strProblem = strOption == L"--help" ? L"" : L"unknown or incomplete option " + strOption;
            return false;
        }
    }
    return true;
}

bool ReadScript(const std::wstring& strPath, std::vector<std::wstring>& vecLines)
{
    CHandle hFile(::CreateFileW(strPath.c_str(), GENERIC_READ, FILE_SHARE_READ, nullptr, OPEN_EXISTING, 0, nullptr));
    if (!hFile) return false;
    std::string strBytes;
    char szBuffer[4096];
    DWORD cbRead = 0;
    while (::ReadFile(hFile.Get(), szBuffer, sizeof(szBuffer), &cbRead, nullptr) && cbRead > 0) strBytes.append(szBuffer, cbRead);
    if (strBytes.rfind("\xEF\xBB\xBF", 0) == 0) strBytes.erase(0, 3);
    std::wstring strText = Utf8ToWide(strBytes);
    for (size_t nStart = 0; nStart < strText.size();) {
        size_t nEnd = strText.find(L'\n', nStart);
        if (nEnd == std::wstring::npos) nEnd = strText.size();
        std::wstring strLine = strText.substr(nStart, nEnd - nStart);
        if (!strLine.empty() && strLine.back() == L'\r') strLine.pop_back();
        vecLines.push_back(strLine);
        nStart = nEnd + 1;
    }
    return true;
}

bool IsServerGone(HRESULT hr)
{
    return hr == HRESULT_FROM_WIN32(RPC_S_SERVER_UNAVAILABLE) || hr == HRESULT_FROM_WIN32(RPC_S_CALL_FAILED) ||
           hr == RPC_E_DISCONNECTED;
}

std::wstring VariantText(const VARIANT& var)
{
    if (V_VT(&var) == VT_EMPTY) return std::wstring();
    CComVariant varText;
    if (FAILED(::VariantChangeType(&varText, const_cast<VARIANT*>(&var), VARIANT_ALPHABOOL, VT_BSTR))) {
        return L"<a value of type " + std::to_wstring(V_VT(&var)) + L">";
    }
    return V_BSTR(&varText) ? std::wstring(V_BSTR(&varText), ::SysStringLen(V_BSTR(&varText))) : std::wstring();
}

// One console session: the host, the prompt loop and the transcript.
class CConsole
{
public:
    explicit CConsole(const ConsoleOptions& options) : m_options(options), m_out(options.color) {}
    int Run();

private:
    enum class Start
    {
        Failed,        // no host
        NotConnected,  // a host that never connected
        Connected,
    };
    Start StartSession();
    void InstallClientHandlers();
    CInputAnswer AnswerPrompt(const std::wstring& strPrompt);
    // Runs one line; false when the session is over.
    bool RunLine(const std::wstring& strLine, bool bEcho);
    bool RunCommand(const ConsoleLine& line);
    void ShowResult(const CallResult& result);
    void Settle();
    void RunScript(const std::vector<std::wstring>& vecLines);
    void RunInteractive();
    int End();
    void ShowLog();

    ConsoleOptions m_options;
    CConsoleOut m_out;
    CLineReader m_stdin;
    CReplSession m_session;
    std::vector<std::wstring> m_vecAnswers;  // from !answer, first first
    bool m_bLost = false;                    // the host went away mid-session
};

CConsole::Start CConsole::StartSession()
{
    SessionOptions options;
    options.strHostCommand = m_options.strHost.empty()
                                 ? QuoteArg(ProgramDirectory() + L"\\repl_testhost.exe")
                                 : m_options.strHost;
    options.strExtraArgs = m_options.strHostArgs;
    options.host.bDebug = m_options.bLog;
    HRESULT hr = m_session.Start(options);
    if (FAILED(hr)) {
        m_out.Error(L"replconsole: cannot start the host: " + options.strHostCommand + L" (" + DescribeHResult(hr) + L")\n");
        return Start::Failed;
    }
    g_pPipe = &m_session.Pipe();
    ::SetConsoleCtrlHandler(CtrlHandler, TRUE);
    InstallClientHandlers();
    if (!m_session.WaitConnected(m_options.dwTimeoutMs)) {
        m_out.Error(L"replconsole: the host did not connect\n");
        return Start::NotConnected;
    }
    return Start::Connected;
}

void CConsole::InstallClientHandlers()
{
    CReplClientObject& client = m_session.Client();
    client.SetRecording(false);  // a console may run for a long time
    client.SetPrintHandler([this](const std::wstring& strText, bool bIsError) {
        if (bIsError) m_out.Error(strText);
        else m_out.Out(strText);
    });
    client.SetInputHandler([this](const std::wstring& strPrompt) { return AnswerPrompt(strPrompt); });
}

// A prompt is answered by the next !answer, else by a line of our stdin;
// either is shown after the prompt as if typed.
CInputAnswer CConsole::AnswerPrompt(const std::wstring& strPrompt)
{
    m_out.Out(strPrompt);
    std::wstring strAnswer;
    if (!m_vecAnswers.empty()) {
        strAnswer = m_vecAnswers.front();
        m_vecAnswers.erase(m_vecAnswers.begin());
    } else if (m_stdin.Next(strAnswer, nullptr) != CLineReader::Result::Line) {
        m_out.Out(L"\n");
        return CInputAnswer::NoInput();
    } else if (m_stdin.IsConsole()) {
        return CInputAnswer::Text(strAnswer);  // the console showed it already
    }
    m_out.Out(strAnswer + L"\n");
    return CInputAnswer::Text(strAnswer);
}

void CConsole::ShowResult(const CallResult& result)
{
    m_out.EnsureLineStart();
    const HRESULT hr = result.Effective();
    if (SUCCEEDED(result.hr)) {
        std::wstring strText = VariantText(result.varResult);
        if (!strText.empty()) m_out.Out(strText + L"\n");
    } else if (hr == E_ABORT) {
        m_out.Error(L"interrupted" + (result.strDescription.empty() ? L"" : L": " + result.strDescription) + L"\n");
    } else if (hr == DISP_E_EXCEPTION) {
        m_out.Error(L"error: " + (result.strDescription.empty() ? L"the command failed" : result.strDescription) + L"\n");
    } else {
        m_out.Error(L"error " + DescribeHResult(hr) +
                    (result.strDescription.empty() ? L"" : L": " + result.strDescription) + L"\n");
    }
    m_bLost = m_bLost || IsServerGone(hr);
}

// Output that Python threads queued reaches us in calls right after a
// command returns; a short quiet spell shows it before the next prompt.
void CConsole::Settle()
{
    const ULONGLONG ullEnd = ::GetTickCount64() + kSettleMaxMs;
    size_t nSeen = m_session.Client().CallCount();
    for (;;) {
        PumpFor(kQuietMs);
        size_t nNow = m_session.Client().CallCount();
        if (nNow == nSeen || ::GetTickCount64() >= ullEnd) return;
        nSeen = nNow;
    }
}

bool CConsole::RunCommand(const ConsoleLine& line)
{
    CComPtr<IDispatch> spServer = m_session.Server();
    if (!spServer) {
        m_out.Error(L"the server has ended the session\n");
        return false;
    }
    if (line.kind == ConsoleLine::Kind::ExecCom) {
        CComVariant varArgument;
        wchar_t* pszEnd = nullptr;
        long nValue = std::wcstol(line.strArgument.c_str(), &pszEnd, 10);
        if (!line.strArgument.empty() && *pszEnd == L'\0') {
            V_VT(&varArgument) = VT_I4;
            V_I4(&varArgument) = nValue;
        } else {
            V_VT(&varArgument) = VT_BSTR;
            V_BSTR(&varArgument) = ::SysAllocString(line.strArgument.c_str());
        }
        ShowResult(CallExecCom(spServer, line.strCommand, varArgument));
    } else if (line.chInterrupt != 0) {
        CDelayedInterrupt interrupt(m_session.Pipe(), line.dwMs, line.chInterrupt);
        ShowResult(CallExec(spServer, line.strCommand, line.strArgument));
    } else {
        ShowResult(CallExec(spServer, line.strCommand, line.strArgument));
    }
    if (!m_bLost) Settle();
    return !m_bLost && m_session.Client().IsConnected();
}

bool CConsole::RunLine(const std::wstring& strLine, bool bEcho)
{
    ConsoleLine line = ParseConsoleLine(strLine);
    switch (line.kind) {
    case ConsoleLine::Kind::Blank:
        return true;
    case ConsoleLine::Kind::Comment:
        if (bEcho) {
            m_out.EnsureLineStart();
            m_out.Out(line.strArgument + L"\n");
        }
        return true;
    case ConsoleLine::Kind::Answer:
        m_vecAnswers.push_back(line.strArgument);
        return true;
    case ConsoleLine::Kind::Sleep:
        PumpFor(line.dwMs);
        return true;
    case ConsoleLine::Kind::Quit:
        return false;
    case ConsoleLine::Kind::Invalid:
        m_out.Error(L"replconsole: " + line.strError + L": " + strLine + L"\n");
        return true;
    default:
        if (bEcho) {
            m_out.EnsureLineStart();
            m_out.Out(kPrompt + line.EchoText() + L"\n");
        }
        return RunCommand(line);
    }
}

void CConsole::RunScript(const std::vector<std::wstring>& vecLines)
{
    for (const std::wstring& strLine : vecLines) {
        if (m_session.Host().HasExited() || !RunLine(strLine, true)) return;
    }
}

void CConsole::RunInteractive()
{
    for (;;) {
        m_out.EnsureLineStart();
        m_out.Out(kPrompt);
        std::wstring strLine;
        CLineReader::Result result = m_stdin.Next(strLine, m_session.Host().ProcessHandle());
        if (result != CLineReader::Result::Line) {
            m_out.Out(L"\n");
            if (result == CLineReader::Result::Aborted) m_out.Error(L"the host has exited\n");
            return;
        }
        // A console shows what was typed; a pipe's lines are shown here.
        if (!m_stdin.IsConsole()) m_out.Out(strLine + L"\n");
        if (!RunLine(strLine, false)) return;
    }
}

void CConsole::ShowLog()
{
    m_out.EnsureLineStart();
    m_out.Out(L"--- host log ---\n");
    for (const std::string& strLine : m_session.Host().Lines()) {
        std::wstring strText = Utf8ToWide(strLine);
        m_out.Out(strText.empty() || strText.back() != L'\n' ? strText + L"\n" : strText);
    }
}

int CConsole::End()
{
    CallResult quit;
    std::optional<DWORD> dwExitCode = m_session.Finish(m_options.dwTimeoutMs, &quit);
    g_pPipe = nullptr;
    m_out.EnsureLineStart();
    if (quit.hr != E_UNEXPECTED && FAILED(quit.hr)) m_out.Error(L"Quit failed: " + DescribeHResult(quit.hr) + L"\n");
    if (dwExitCode) {
        m_out.Out(L"--- host exited with code " + std::to_wstring(*dwExitCode) + L"\n");
    } else {
        m_out.Error(L"replconsole: the host did not exit\n");
    }
    if (m_options.bLog) ShowLog();
    bool bClean = dwExitCode == std::optional<DWORD>(0) && m_session.Client().WasDetached();
    return bClean ? kExitClean : kExitUnclean;
}

int CConsole::Run()
{
    std::vector<std::wstring> vecScript;
    if (!m_options.strScript.empty() && !ReadScript(m_options.strScript, vecScript)) {
        m_out.Error(L"replconsole: cannot read " + m_options.strScript + L"\n");
        return kExitUsage;
    }
    Start start = StartSession();
    if (start != Start::Connected) {
        if (start == Start::NotConnected) End();  // shows the host's exit and log
        return kExitNoSession;
    }
    if (m_options.strScript.empty()) RunInteractive();
    else RunScript(vecScript);
    return End();
}

}  // namespace

int main()
{
    ConsoleOptions options;
    std::wstring strProblem;
    if (!ParseOptions(options, strProblem)) return Usage(strProblem.empty() ? nullptr : strProblem.c_str());
    if (const char* pszNoColor = std::getenv("NO_COLOR"); pszNoColor && *pszNoColor && options.color == ColorMode::Auto) {
        options.color = ColorMode::Never;
    }
    if (FAILED(::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED))) return kExitNoSession;
    int nResult = kExitUsage;
    {
        CConsole console(options);
        nResult = console.Run();
    }
    ::CoUninitialize();
    return nResult;
}
