#pragma once
// The console's own input and output: text to stdout and error text to
// stderr (in red where that can be shown), and lines from stdin read by a
// thread of their own so that the apartment thread keeps pumping while the
// user types.
#include <windows.h>

#include <deque>
#include <optional>
#include <string>

#include "common/Raii.h"

enum class ColorMode
{
    Auto,    // red where supported (see CConsoleOut)
    Always,  // ANSI red even into files and pipes
    Never,
};

class CConsoleOut
{
public:
    explicit CConsoleOut(ColorMode mode);
    ~CConsoleOut();
    CConsoleOut(const CConsoleOut&) = delete;
    CConsoleOut& operator=(const CConsoleOut&) = delete;

    void Out(const std::wstring& strText);    // standard output
    void Error(const std::wstring& strText);  // error text, coloured
    // Ends a line that output left open, so that what follows starts on its own.
    void EnsureLineStart();

private:
    enum class Style
    {
        Plain,
        Ansi,       // escape sequences
        Attribute,  // a console without escape sequence support
    };
    struct Stream
    {
        HANDLE h = nullptr;
        bool bConsole = false;
        Style style = Style::Plain;
        DWORD dwOldMode = 0;
        bool bModeChanged = false;
        WORD wOldAttributes = 0;
    };

    static void Prepare(Stream& stream, DWORD dwStdHandle, ColorMode mode);
    static void Write(const Stream& stream, const std::wstring& strText);
    void Track(const std::wstring& strText);

    Stream m_out;
    Stream m_err;
    wchar_t m_chLast = L'\n';
};

// Lines from stdin, read ahead by a thread started on first use.
class CLineReader
{
public:
    enum class Result
    {
        Line,
        EndOfInput,
        Aborted,  // hAbort was signaled first
    };

    CLineReader();
    ~CLineReader();
    CLineReader(const CLineReader&) = delete;
    CLineReader& operator=(const CLineReader&) = delete;

    // Waits (pumping messages) for the next line, without its line end.
    Result Next(std::wstring& strLine, HANDLE hAbort);
    // True when stdin is a console, which echoes typed lines itself.
    bool IsConsole() const noexcept { return m_bConsole; }

    // Internal: the reader thread's loop.
    void ReadLoop();

private:
    void Push(std::optional<std::wstring> line);
    bool ReadConsoleLine(std::wstring& strLine);

    CCritSec m_cs;
    std::deque<std::optional<std::wstring>> m_queLines;  // nullopt: end of input
    CHandle m_hAvailable;                                // set while the queue is not empty
    CHandle m_hThread;
    HANDLE m_hStdin;
    bool m_bConsole;
};
