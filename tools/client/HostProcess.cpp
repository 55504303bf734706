#include "client/HostProcess.h"

#include <process.h>

#include <atomic>

#include "client/MessagePump.h"
#include "common/Raii.h"

namespace {

constexpr DWORD kDebugPollMs = 50;             // how soon the debugger notices a stop request
constexpr SIZE_T kMaxDebugString = 1 << 20;    // longer strings are cut
constexpr DWORD kStatusWx86Breakpoint = 0x4000001F;

// A thread running a __stdcall procedure; the parameter is handed over.
HANDLE StartThread(unsigned(__stdcall* pfnProc)(void*), void* pvParam)
{
    return reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, pfnProc, pvParam, 0, nullptr));
}

// An inheritable duplicate of one of our handles (null stays null).
HANDLE InheritableCopy(HANDLE h)
{
    if (h == nullptr || h == INVALID_HANDLE_VALUE) return nullptr;
    HANDLE hCopy = nullptr;
    HANDLE hSelf = ::GetCurrentProcess();
    return ::DuplicateHandle(hSelf, h, hSelf, &hCopy, 0, TRUE, DUPLICATE_SAME_ACCESS) ? hCopy : nullptr;
}

// A pipe with one end inheritable: bInheritRead picks which.
HRESULT MakePipe(CHandle& hRead, CHandle& hWrite, bool bInheritRead)
{
    SECURITY_ATTRIBUTES sa = {sizeof(sa), nullptr, TRUE};
    HANDLE hR = nullptr, hW = nullptr;
    if (!::CreatePipe(&hR, &hW, &sa, 0)) return HRESULT_FROM_WIN32(::GetLastError());
    hRead.Reset(hR);
    hWrite.Reset(hW);
    HANDLE hOurs = bInheritRead ? hW : hR;
    if (!::SetHandleInformation(hOurs, HANDLE_FLAG_INHERIT, 0)) return HRESULT_FROM_WIN32(::GetLastError());
    return S_OK;
}

std::string ReadDebugString(HANDLE hProcess, const OUTPUT_DEBUG_STRING_INFO& info)
{
    const SIZE_T cbChar = info.fUnicode ? 2 : 1;
    SIZE_T cch = info.nDebugStringLength;
    if (cch * cbChar > kMaxDebugString) cch = kMaxDebugString / cbChar;
    std::string strBytes(cch * cbChar, '\0');
    SIZE_T cbRead = 0;
    if (cch == 0 || !::ReadProcessMemory(hProcess, info.lpDebugStringData, &strBytes[0], strBytes.size(), &cbRead)) {
        return std::string();
    }
    strBytes.resize(cbRead - cbRead % cbChar);
    if (!info.fUnicode) return strBytes.substr(0, strBytes.find('\0'));
    std::wstring strWide(reinterpret_cast<const wchar_t*>(strBytes.data()), strBytes.size() / 2);
    return WideToUtf8(strWide.substr(0, strWide.find(L'\0')));
}

}  // namespace

struct CHostProcess::State
{
    HostOptions options;
    mutable CCritSec cs;
    std::vector<std::string> vecLines;
    std::string strOutput;
    std::optional<DWORD> dwDebugExitCode;

    CHandle hProcess;
    DWORD dwProcessId = 0;
    bool bAttach = false;

    // Handed to the child at creation; ours are closed once it exists.
    CHandle hChildStdin, hChildStdout, hChildStderr;
    CHandle hOutputRead, hStdinWrite;
    std::string strStdin;

    CHandle hDebugThread, hOutputThread, hStdinThread;
    CHandle hStarted;  // set by the debugger thread once the child exists
    HRESULT hrStart = E_PENDING;
    std::atomic<bool> bStopDebugging{false};

    HRESULT CreateChild(DWORD dwExtraFlags);
    HRESULT PrepareStdio();
    void AddLine(std::string strLine) noexcept;
    void ShowDebugString(HANDLE hDebuggee, const OUTPUT_DEBUG_STRING_INFO& info) noexcept;
    void DebugLoop();
};

HRESULT CHostProcess::State::PrepareStdio()
{
    HRESULT hr = S_OK;
    if (options.bCaptureOutput) {
        hr = MakePipe(hOutputRead, hChildStdout, false);
        if (SUCCEEDED(hr)) hChildStderr.Reset(InheritableCopy(hChildStdout.Get()));
    } else {
        hChildStdout.Reset(InheritableCopy(::GetStdHandle(STD_OUTPUT_HANDLE)));
        hChildStderr.Reset(InheritableCopy(::GetStdHandle(STD_ERROR_HANDLE)));
    }
    if (FAILED(hr)) return hr;
    if (options.strStdin) {
        strStdin = *options.strStdin;
        return MakePipe(hChildStdin, hStdinWrite, true);
    }
    if (options.bShareStdin) {
        hChildStdin.Reset(InheritableCopy(::GetStdHandle(STD_INPUT_HANDLE)));
        return S_OK;
    }
    SECURITY_ATTRIBUTES sa = {sizeof(sa), nullptr, TRUE};
    hChildStdin.Reset(::CreateFileW(L"NUL", GENERIC_READ, FILE_SHARE_READ | FILE_SHARE_WRITE, &sa, OPEN_EXISTING,
                                    0, nullptr));
    return S_OK;
}

HRESULT CHostProcess::State::CreateChild(DWORD dwExtraFlags)
{
    STARTUPINFOW si = {};
    si.cb = sizeof(si);
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdInput = hChildStdin.Get();
    si.hStdOutput = hChildStdout.Get();
    si.hStdError = hChildStderr.Get();
    std::wstring strCommand = options.strCommandLine;  // CreateProcessW may write into it
    DWORD dwFlags = dwExtraFlags | (options.bNewProcessGroup ? CREATE_NEW_PROCESS_GROUP : 0);
    PROCESS_INFORMATION pi = {};
    if (!::CreateProcessW(nullptr, &strCommand[0], nullptr, nullptr, TRUE, dwFlags, nullptr,
                          options.strWorkingDir.empty() ? nullptr : options.strWorkingDir.c_str(), &si, &pi)) {
        return HRESULT_FROM_WIN32(::GetLastError());
    }
    ::CloseHandle(pi.hThread);
    hProcess.Reset(pi.hProcess);
    dwProcessId = pi.dwProcessId;
    return S_OK;
}

// Never throws: the child stays stopped until the debugger goes on, so a
// line that cannot be kept (memory exhausted) or shown is dropped.
void CHostProcess::State::AddLine(std::string strLine) noexcept
{
    try {
        {
            CCritSecLock lock(cs);
            vecLines.push_back(strLine);
        }
        if (options.fnDebugLine) options.fnDebugLine(strLine);
    } catch (...) {
    }
}

void CHostProcess::State::ShowDebugString(HANDLE hDebuggee, const OUTPUT_DEBUG_STRING_INFO& info) noexcept
{
    try {
        std::string strLine = ReadDebugString(hDebuggee, info);
        if (!strLine.empty()) AddLine(std::move(strLine));
    } catch (...) {
    }
}

// The debug event loop, on the thread that created or attached to the child.
void CHostProcess::State::DebugLoop()
{
    ::DebugSetProcessKillOnExit(FALSE);
    bool bSeenBreakpoint = false;
    HANDLE hDebuggee = nullptr;  // from CREATE_PROCESS; the system closes it at the end
    for (;;) {
        DEBUG_EVENT ev = {};
        if (!::WaitForDebugEvent(&ev, kDebugPollMs)) {
            if (bStopDebugging) {
                ::DebugActiveProcessStop(dwProcessId);
                return;
            }
            continue;
        }
        DWORD dwContinue = DBG_CONTINUE;
        bool bExited = false;
        switch (ev.dwDebugEventCode) {
        case CREATE_PROCESS_DEBUG_EVENT:
            hDebuggee = ev.u.CreateProcessInfo.hProcess;
            if (ev.u.CreateProcessInfo.hFile) ::CloseHandle(ev.u.CreateProcessInfo.hFile);
            break;
        case LOAD_DLL_DEBUG_EVENT:
            if (ev.u.LoadDll.hFile) ::CloseHandle(ev.u.LoadDll.hFile);
            break;
        case OUTPUT_DEBUG_STRING_EVENT:
            ShowDebugString(hDebuggee ? hDebuggee : hProcess.Get(), ev.u.DebugString);
            break;
        case EXCEPTION_DEBUG_EVENT: {
            // The loader's (or the attach's) first breakpoint is ours; every
            // other exception goes to the child's own handlers.
            DWORD dwCode = ev.u.Exception.ExceptionRecord.ExceptionCode;
            bool bFirstBreak = !bSeenBreakpoint && (dwCode == EXCEPTION_BREAKPOINT || dwCode == kStatusWx86Breakpoint);
            bSeenBreakpoint = bSeenBreakpoint || bFirstBreak;
            dwContinue = bFirstBreak ? DBG_CONTINUE : DBG_EXCEPTION_NOT_HANDLED;
            break;
        }
        case EXIT_PROCESS_DEBUG_EVENT: {
            CCritSecLock lock(cs);
            dwDebugExitCode = ev.u.ExitProcess.dwExitCode;
            bExited = true;
            break;
        }
        default:
            break;
        }
        ::ContinueDebugEvent(ev.dwProcessId, ev.dwThreadId, dwContinue);
        if (bExited) return;
        if (bStopDebugging) {
            ::DebugActiveProcessStop(dwProcessId);
            return;
        }
    }
}

// The thread procedures. Each thread owns a reference to the state, so that
// an object destroyed while a thread still blocks never pulls the state from
// under it.
struct HostThreads
{
    using StateRef = std::shared_ptr<CHostProcess::State>;

    static unsigned __stdcall DebugCreateProc(void* pvParam)
    {
        StateRef spState(*static_cast<StateRef*>(pvParam));
        delete static_cast<StateRef*>(pvParam);
        spState->hrStart = spState->CreateChild(DEBUG_ONLY_THIS_PROCESS);
        bool bStarted = SUCCEEDED(spState->hrStart);
        ::SetEvent(spState->hStarted.Get());
        if (bStarted) spState->DebugLoop();
        return 0;
    }

    static unsigned __stdcall DebugAttachProc(void* pvParam)
    {
        StateRef spState(*static_cast<StateRef*>(pvParam));
        delete static_cast<StateRef*>(pvParam);
        BOOL bAttached = ::DebugActiveProcess(spState->dwProcessId);
        spState->hrStart = bAttached ? S_OK : HRESULT_FROM_WIN32(::GetLastError());
        ::SetEvent(spState->hStarted.Get());
        if (bAttached) spState->DebugLoop();
        return 0;
    }

    static unsigned __stdcall OutputProc(void* pvParam)
    {
        StateRef spState(*static_cast<StateRef*>(pvParam));
        delete static_cast<StateRef*>(pvParam);
        char szBuffer[4096];
        DWORD cbRead = 0;
        while (::ReadFile(spState->hOutputRead.Get(), szBuffer, sizeof(szBuffer), &cbRead, nullptr) && cbRead > 0) {
            try {
                std::string strChunk(szBuffer, cbRead);
                {
                    CCritSecLock lock(spState->cs);
                    spState->strOutput += strChunk;
                }
                if (spState->options.fnOutput) spState->options.fnOutput(strChunk);
            } catch (...) {
                // Output that cannot be kept is dropped; reading goes on so
                // that the child never blocks on a full pipe.
            }
        }
        return 0;
    }

    static unsigned __stdcall StdinProc(void* pvParam)
    {
        StateRef spState(*static_cast<StateRef*>(pvParam));
        delete static_cast<StateRef*>(pvParam);
        const std::string& strData = spState->strStdin;
        DWORD cbWritten = 0;
        if (!strData.empty()) {
            ::WriteFile(spState->hStdinWrite.Get(), strData.data(), static_cast<DWORD>(strData.size()), &cbWritten,
                        nullptr);
        }
        spState->hStdinWrite.Reset();  // end of input for the child
        return 0;
    }

    static HANDLE Start(unsigned(__stdcall* pfnProc)(void*), const StateRef& spState)
    {
        StateRef* pRef = new StateRef(spState);
        HANDLE hThread = StartThread(pfnProc, pRef);
        if (hThread == nullptr) delete pRef;
        return hThread;
    }
};

CHostProcess::CHostProcess() : m_spState(std::make_shared<State>()) {}

CHostProcess::~CHostProcess()
{
    Detach();
    // A reader still blocked (the child lives on, or a grandchild holds the
    // pipe) is woken; if it will not end, it keeps its own reference.
    for (CHandle* phThread : {&m_spState->hOutputThread, &m_spState->hStdinThread}) {
        if (*phThread && ::WaitForSingleObject(phThread->Get(), 0) == WAIT_TIMEOUT) {
            ::CancelSynchronousIo(phThread->Get());
            ::WaitForSingleObject(phThread->Get(), 1000);
        }
    }
}

HRESULT CHostProcess::Start(const HostOptions& options)
{
    State& state = *m_spState;
    if (state.hProcess || state.hDebugThread) return HRESULT_FROM_WIN32(ERROR_ALREADY_INITIALIZED);
    state.options = options;
    HRESULT hr = state.PrepareStdio();
    if (SUCCEEDED(hr) && options.bDebug) {
        state.hStarted.Reset(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
        state.hDebugThread.Reset(HostThreads::Start(HostThreads::DebugCreateProc, m_spState));
        hr = state.hDebugThread ? S_OK : E_OUTOFMEMORY;
        if (SUCCEEDED(hr)) {
            ::WaitForSingleObject(state.hStarted.Get(), INFINITE);
            hr = state.hrStart;
        }
    } else if (SUCCEEDED(hr)) {
        hr = state.CreateChild(0);
    }
    // The child has its copies now (or never will).
    state.hChildStdin.Reset();
    state.hChildStdout.Reset();
    state.hChildStderr.Reset();
    if (FAILED(hr)) return hr;
    if (state.hOutputRead) state.hOutputThread.Reset(HostThreads::Start(HostThreads::OutputProc, m_spState));
    if (state.hStdinWrite) state.hStdinThread.Reset(HostThreads::Start(HostThreads::StdinProc, m_spState));
    return S_OK;
}

HRESULT CHostProcess::Attach(DWORD dwProcessId, const HostOptions& options)
{
    State& state = *m_spState;
    if (state.hProcess || state.hDebugThread) return HRESULT_FROM_WIN32(ERROR_ALREADY_INITIALIZED);
    state.options = options;
    state.bAttach = true;
    state.dwProcessId = dwProcessId;
    state.hProcess.Reset(
        ::OpenProcess(SYNCHRONIZE | PROCESS_QUERY_LIMITED_INFORMATION | PROCESS_TERMINATE, FALSE, dwProcessId));
    if (!state.hProcess) return HRESULT_FROM_WIN32(::GetLastError());
    state.hStarted.Reset(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    state.hDebugThread.Reset(HostThreads::Start(HostThreads::DebugAttachProc, m_spState));
    if (!state.hDebugThread) return E_OUTOFMEMORY;
    ::WaitForSingleObject(state.hStarted.Get(), INFINITE);
    if (FAILED(state.hrStart)) {
        ::WaitForSingleObject(state.hDebugThread.Get(), INFINITE);
        state.hDebugThread.Reset();
    }
    return state.hrStart;
}

void CHostProcess::Detach()
{
    State& state = *m_spState;
    if (!state.hDebugThread) return;
    state.bStopDebugging = true;
    ::WaitForSingleObject(state.hDebugThread.Get(), INFINITE);
}

DWORD CHostProcess::ProcessId() const noexcept
{
    return m_spState->dwProcessId;
}

HANDLE CHostProcess::ProcessHandle() const noexcept
{
    return m_spState->hProcess.Get();
}

std::vector<std::string> CHostProcess::Lines() const
{
    CCritSecLock lock(m_spState->cs);
    return m_spState->vecLines;
}

bool CHostProcess::WaitForLine(const std::function<bool(const std::string&)>& fnMatch, DWORD dwTimeoutMs,
                               std::string* pstrLine, bool bPump) const
{
    size_t nChecked = 0;
    bool bFound = false;
    auto fnDone = [&]() {
        // The debugger's end is read before the lines, so that lines that
        // came just before the exit are still searched.
        bool bEnded = !m_spState->hDebugThread || ::WaitForSingleObject(m_spState->hDebugThread.Get(), 0) == WAIT_OBJECT_0;
        CCritSecLock lock(m_spState->cs);
        for (; nChecked < m_spState->vecLines.size() && !bFound; ++nChecked) {
            if (fnMatch(m_spState->vecLines[nChecked])) {
                bFound = true;
                if (pstrLine) *pstrLine = m_spState->vecLines[nChecked];
            }
        }
        return bFound || bEnded;
    };
    if (bPump) {
        PumpUntil(fnDone, dwTimeoutMs);
    } else {
        const ULONGLONG ullDeadline = ::GetTickCount64() + dwTimeoutMs;
        while (!fnDone() && ::GetTickCount64() < ullDeadline) ::Sleep(5);
    }
    return bFound;
}

bool CHostProcess::WaitForLine(const std::string& strText, DWORD dwTimeoutMs, std::string* pstrLine,
                               bool bPump) const
{
    return WaitForLine([&strText](const std::string& strLine) { return strLine.find(strText) != std::string::npos; },
                       dwTimeoutMs, pstrLine, bPump);
}

std::string CHostProcess::Output() const
{
    CCritSecLock lock(m_spState->cs);
    return m_spState->strOutput;
}

std::optional<DWORD> CHostProcess::WaitForExit(DWORD dwTimeoutMs, bool bPump)
{
    State& state = *m_spState;
    if (!state.hProcess) return std::nullopt;
    // The process first, then the debugger that reports its last lines and
    // the captured output to its end.
    std::vector<HANDLE> vecWaits = {state.hProcess.Get()};
    if (state.hDebugThread) vecWaits.push_back(state.hDebugThread.Get());
    if (state.hOutputThread) vecWaits.push_back(state.hOutputThread.Get());
    const ULONGLONG ullDeadline = ::GetTickCount64() + dwTimeoutMs;
    for (HANDLE hWait : vecWaits) {
        ULONGLONG ullNow = ::GetTickCount64();
        DWORD dwLeft = dwTimeoutMs == INFINITE ? INFINITE
                       : ullNow >= ullDeadline ? 0 : static_cast<DWORD>(ullDeadline - ullNow);
        bool bDone = bPump ? PumpWait(hWait, dwLeft) : ::WaitForSingleObject(hWait, dwLeft) == WAIT_OBJECT_0;
        // An output pipe that a grandchild keeps open does not hold us up.
        if (!bDone && hWait != state.hOutputThread.Get()) return std::nullopt;
    }
    {
        CCritSecLock lock(state.cs);
        if (state.dwDebugExitCode) return state.dwDebugExitCode;
    }
    DWORD dwExitCode = 0;
    if (!::GetExitCodeProcess(state.hProcess.Get(), &dwExitCode)) return std::nullopt;
    return dwExitCode;
}

bool CHostProcess::HasExited() const noexcept
{
    return m_spState->hProcess && ::WaitForSingleObject(m_spState->hProcess.Get(), 0) == WAIT_OBJECT_0;
}

void CHostProcess::Kill(UINT uExitCode) noexcept
{
    if (m_spState->hProcess) ::TerminateProcess(m_spState->hProcess.Get(), uExitCode);
}

// ---- helpers -----------------------------------------------------------------------

std::wstring QuoteArg(const std::wstring& strArg)
{
    if (!strArg.empty() && strArg.find_first_of(L" \t\n\v\"") == std::wstring::npos) return strArg;
    std::wstring strQuoted = L"\"";
    size_t nBackslashes = 0;
    for (wchar_t ch : strArg) {
        if (ch == L'\\') {
            ++nBackslashes;
            continue;
        }
        // Backslashes before a quote are doubled, and the quote escaped.
        strQuoted.append(ch == L'"' ? nBackslashes * 2 + 1 : nBackslashes, L'\\');
        strQuoted += ch;
        nBackslashes = 0;
    }
    strQuoted.append(nBackslashes * 2, L'\\');  // before the closing quote
    return strQuoted + L"\"";
}

std::wstring ProgramDirectory()
{
    std::wstring strPath(MAX_PATH, L'\0');
    for (;;) {
        DWORD cch = ::GetModuleFileNameW(nullptr, &strPath[0], static_cast<DWORD>(strPath.size()));
        if (cch == 0) return std::wstring();
        if (cch < strPath.size()) {
            strPath.resize(cch);
            break;
        }
        strPath.resize(strPath.size() * 2);
    }
    size_t nSlash = strPath.find_last_of(L"\\/");
    return nSlash == std::wstring::npos ? std::wstring(L".") : strPath.substr(0, nSlash);
}

std::wstring Utf8ToWide(const std::string& str)
{
    if (str.empty()) return std::wstring();
    int cch = ::MultiByteToWideChar(CP_UTF8, 0, str.data(), static_cast<int>(str.size()), nullptr, 0);
    std::wstring strWide(static_cast<size_t>(cch), L'\0');
    ::MultiByteToWideChar(CP_UTF8, 0, str.data(), static_cast<int>(str.size()), &strWide[0], cch);
    return strWide;
}

std::string WideToUtf8(const std::wstring& str)
{
    if (str.empty()) return std::string();
    int cb = ::WideCharToMultiByte(CP_UTF8, 0, str.data(), static_cast<int>(str.size()), nullptr, 0, nullptr, nullptr);
    std::string strNarrow(static_cast<size_t>(cb), '\0');
    ::WideCharToMultiByte(CP_UTF8, 0, str.data(), static_cast<int>(str.size()), &strNarrow[0], cb, nullptr, nullptr);
    return strNarrow;
}
