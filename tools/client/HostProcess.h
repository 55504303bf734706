#pragma once
// CHostProcess: a child process (the host that loads ReplServer), started
// with handle inheritance so that it receives the interrupt pipe's read end,
// optionally under the debug API so that its debug output (ReplServer's log)
// is collected line by line; or a process started by someone else, attached
// to as a debugger.
//
// Debug mode: a dedicated thread creates the process with
// DEBUG_ONLY_THIS_PROCESS (or attaches with DebugActiveProcess) and runs the
// debug event loop: each OUTPUT_DEBUG_STRING_EVENT becomes one line, read
// whole from the child's memory; exceptions are passed on to the child's
// own handlers; the exit code is taken from EXIT_PROCESS_DEBUG_EVENT. The
// debugger never takes the child down with it (kill-on-exit is off), and
// destroying the object detaches from a child that still runs.
//
// Waits pump messages by default, because the thread that waits is usually
// the client's apartment thread and must keep serving the host's calls.
#include <windows.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

struct HostOptions
{
    // The whole command line, program first (quote it with QuoteArg).
    std::wstring strCommandLine;
    // Working directory; empty: ours.
    std::wstring strWorkingDir;
    // Run under the debug API and collect the child's debug output.
    bool bDebug = false;
    // Capture the child's stdout and stderr together through one pipe
    // (Output()); otherwise the child shares ours.
    bool bCaptureOutput = false;
    // The child's stdin: when set, these bytes through a pipe that is then
    // closed; otherwise ours with bShareStdin, else the NUL device, so that
    // a host never competes with a console for its input.
    std::optional<std::string> strStdin;
    bool bShareStdin = false;
    // A new process group: the child does not receive the console's Ctrl+C
    // (the client forwards interrupts through the pipe instead).
    bool bNewProcessGroup = true;
    // Called on the debugger thread for each debug line, as it arrives.
    std::function<void(const std::string& strLine)> fnDebugLine;
    // Called on the capture thread for each chunk of captured output.
    std::function<void(const std::string& strChunk)> fnOutput;
};

class CHostProcess
{
public:
    CHostProcess();
    ~CHostProcess();  // detaches the debugger; never kills the child
    CHostProcess(const CHostProcess&) = delete;
    CHostProcess& operator=(const CHostProcess&) = delete;

    // Starts the child; returns once it exists (in debug mode, once the
    // debugger thread has created it). Every inheritable handle of this
    // process is inherited. One start (or attach) per object.
    HRESULT Start(const HostOptions& options);
    // Debugs a running process (DebugActiveProcess): only the debug-output
    // options of HostOptions count. Lines start with what the process
    // writes after the attach.
    HRESULT Attach(DWORD dwProcessId, const HostOptions& options = HostOptions());
    // Stops debugging a child that goes on running; collected lines stay.
    void Detach();

    DWORD ProcessId() const noexcept;
    HANDLE ProcessHandle() const noexcept;  // synchronize, query, terminate

    // Every debug string received so far, each exactly as the child wrote
    // it (a log line keeps its "\n"); a wide string arrives as UTF-8.
    std::vector<std::string> Lines() const;
    // Waits for a line for which fnMatch is true (lines already received
    // count) and gives it in *pstrLine; false at the timeout or when the
    // child has exited without one.
    bool WaitForLine(const std::function<bool(const std::string&)>& fnMatch, DWORD dwTimeoutMs,
                     std::string* pstrLine = nullptr, bool bPump = true) const;
    // The same for a line that contains strText.
    bool WaitForLine(const std::string& strText, DWORD dwTimeoutMs, std::string* pstrLine = nullptr,
                     bool bPump = true) const;

    // The captured stdout and stderr so far.
    std::string Output() const;

    // Waits for the child to exit (in debug mode, also for the debugger to
    // have seen every line) and gives its exit code; nothing at the timeout.
    std::optional<DWORD> WaitForExit(DWORD dwTimeoutMs, bool bPump = true);
    bool HasExited() const noexcept;
    // Ends the child (TerminateProcess) with the given code.
    void Kill(UINT uExitCode = 1) noexcept;

private:
    struct State;
    friend struct HostThreads;
    std::shared_ptr<State> m_spState;
};

// Quotes one argument for a Windows command line (CommandLineToArgvW rules).
std::wstring QuoteArg(const std::wstring& strArg);
// The full path of the directory that holds this program.
std::wstring ProgramDirectory();
// UTF-8 <-> UTF-16 (invalid sequences are replaced).
std::wstring Utf8ToWide(const std::string& str);
std::string WideToUtf8(const std::wstring& str);
