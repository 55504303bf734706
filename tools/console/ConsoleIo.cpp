#include "ConsoleIo.h"

#include <process.h>

#include "client/HostProcess.h"
#include "client/MessagePump.h"

#ifndef ENABLE_VIRTUAL_TERMINAL_PROCESSING
#define ENABLE_VIRTUAL_TERMINAL_PROCESSING 0x0004
#endif

namespace {

constexpr wchar_t kAnsiRed[] = L"\x1b[31m";
constexpr wchar_t kAnsiReset[] = L"\x1b[0m";
constexpr WORD kRedAttributes = FOREGROUND_RED | FOREGROUND_INTENSITY;

bool IsConsoleHandle(HANDLE h)
{
    DWORD dwMode = 0;
    return h != nullptr && h != INVALID_HANDLE_VALUE && ::GetConsoleMode(h, &dwMode);
}

unsigned __stdcall LineReaderProc(void* pvParam)
{
    static_cast<CLineReader*>(pvParam)->ReadLoop();
    return 0;
}

}  // namespace

// ---- CConsoleOut -------------------------------------------------------------------

CConsoleOut::CConsoleOut(ColorMode mode)
{
    Prepare(m_out, STD_OUTPUT_HANDLE, mode);
    Prepare(m_err, STD_ERROR_HANDLE, mode);
}

CConsoleOut::~CConsoleOut()
{
    for (Stream* pStream : {&m_out, &m_err}) {
        if (pStream->bModeChanged) ::SetConsoleMode(pStream->h, pStream->dwOldMode);
    }
}

// A console gets escape sequences when it can be switched to understand
// them, colour attributes otherwise; pipes and files get escape sequences
// (a terminal usually reads them) unless colour is off.
void CConsoleOut::Prepare(Stream& stream, DWORD dwStdHandle, ColorMode mode)
{
    stream.h = ::GetStdHandle(dwStdHandle);
    stream.bConsole = IsConsoleHandle(stream.h);
    if (mode == ColorMode::Never) return;
    if (!stream.bConsole) {
        stream.style = Style::Ansi;
        return;
    }
    ::GetConsoleMode(stream.h, &stream.dwOldMode);
    if (::SetConsoleMode(stream.h, stream.dwOldMode | ENABLE_VIRTUAL_TERMINAL_PROCESSING)) {
        stream.bModeChanged = (stream.dwOldMode & ENABLE_VIRTUAL_TERMINAL_PROCESSING) == 0;
        stream.style = Style::Ansi;
        return;
    }
    CONSOLE_SCREEN_BUFFER_INFO info;
    if (::GetConsoleScreenBufferInfo(stream.h, &info)) {
        stream.wOldAttributes = info.wAttributes;
        stream.style = Style::Attribute;
    }
}

void CConsoleOut::Write(const Stream& stream, const std::wstring& strText)
{
    if (strText.empty()) return;
    DWORD dwWritten = 0;
    if (stream.bConsole) {
        ::WriteConsoleW(stream.h, strText.data(), static_cast<DWORD>(strText.size()), &dwWritten, nullptr);
        return;
    }
    std::string strBytes = WideToUtf8(strText);
    ::WriteFile(stream.h, strBytes.data(), static_cast<DWORD>(strBytes.size()), &dwWritten, nullptr);
}

void CConsoleOut::Track(const std::wstring& strText)
{
    if (!strText.empty()) m_chLast = strText.back();
}

void CConsoleOut::Out(const std::wstring& strText)
{
    Write(m_out, strText);
    Track(strText);
}

void CConsoleOut::Error(const std::wstring& strText)
{
    if (m_err.style == Style::Ansi) {
        // The colour ends before a final line end, so that a terminal
        // never carries it into the next line.
        size_t cchBody = !strText.empty() && strText.back() == L'\n' ? strText.size() - 1 : strText.size();
        Write(m_err, kAnsiRed + strText.substr(0, cchBody) + kAnsiReset + strText.substr(cchBody));
    } else if (m_err.style == Style::Attribute) {
        ::SetConsoleTextAttribute(m_err.h, kRedAttributes);
        Write(m_err, strText);
        ::SetConsoleTextAttribute(m_err.h, m_err.wOldAttributes);
    } else {
        Write(m_err, strText);
    }
    Track(strText);
}

void CConsoleOut::EnsureLineStart()
{
    if (m_chLast != L'\n') Out(L"\n");
}

// ---- CLineReader -------------------------------------------------------------------

CLineReader::CLineReader()
    : m_hAvailable(::CreateEventW(nullptr, TRUE, FALSE, nullptr)),
      m_hStdin(::GetStdHandle(STD_INPUT_HANDLE)),
      m_bConsole(IsConsoleHandle(m_hStdin))
{
}

CLineReader::~CLineReader()
{
    // A reader blocked on a console or pipe dies with the process; it only
    // touches this object, which lives as long as the program.
    if (m_hThread) ::CancelSynchronousIo(m_hThread.Get());
}

void CLineReader::Push(std::optional<std::wstring> line)
{
    CCritSecLock lock(m_cs);
    m_queLines.push_back(std::move(line));
    ::SetEvent(m_hAvailable.Get());
}

// One line typed into the console. Ctrl+C interrupts a read without ending
// the input; Ctrl+Z alone on a line ends it.
bool CLineReader::ReadConsoleLine(std::wstring& strLine)
{
    wchar_t szBuffer[1024];
    strLine.clear();
    for (;;) {
        DWORD cchRead = 0;
        if (!::ReadConsoleW(m_hStdin, szBuffer, 1024, &cchRead, nullptr)) {
            if (::GetLastError() == ERROR_OPERATION_ABORTED) continue;
            return false;
        }
        strLine.append(szBuffer, cchRead);
        if (!strLine.empty() && strLine.back() == L'\n') break;
    }
    while (!strLine.empty() && (strLine.back() == L'\n' || strLine.back() == L'\r')) strLine.pop_back();
    return strLine != L"\x1a";
}

void CLineReader::ReadLoop()
{
    if (m_bConsole) {
        std::wstring strLine;
        while (ReadConsoleLine(strLine)) Push(strLine);
        Push(std::nullopt);
        return;
    }
    std::string strPending;
    char szBuffer[4096];
    DWORD cbRead = 0;
    while (::ReadFile(m_hStdin, szBuffer, sizeof(szBuffer), &cbRead, nullptr) && cbRead > 0) {
        strPending.append(szBuffer, cbRead);
        for (size_t nEnd; (nEnd = strPending.find('\n')) != std::string::npos; strPending.erase(0, nEnd + 1)) {
            std::string strLine = strPending.substr(0, nEnd);
            if (!strLine.empty() && strLine.back() == '\r') strLine.pop_back();
            Push(Utf8ToWide(strLine));
        }
    }
    if (!strPending.empty()) Push(Utf8ToWide(strPending));
    Push(std::nullopt);
}

CLineReader::Result CLineReader::Next(std::wstring& strLine, HANDLE hAbort)
{
    if (!m_hThread) m_hThread.Reset(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, LineReaderProc, this, 0, nullptr)));
    if (!m_hThread) return Result::EndOfInput;
    for (;;) {
        {
            CCritSecLock lock(m_cs);
            if (!m_queLines.empty()) {
                std::optional<std::wstring> line = m_queLines.front();
                // The end of input stays queued for every later reader.
                if (line) m_queLines.pop_front();
                if (m_queLines.empty()) ::ResetEvent(m_hAvailable.Get());
                if (!line) return Result::EndOfInput;
                strLine = *line;
                return Result::Line;
            }
        }
        HANDLE hWaits[] = {m_hAvailable.Get(), hAbort};
        DWORD dwWait = PumpWaitAny(hWaits, hAbort ? 2 : 1, INFINITE);
        if (dwWait == WAIT_OBJECT_0 + 1) return Result::Aborted;
        if (dwWait == WAIT_FAILED) return Result::EndOfInput;
    }
}
