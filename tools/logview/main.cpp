// repl_logview: shows a program's debug output (ReplServer's log) as it is
// written, without a debugger.
//
//   repl_logview [--prefix <text>] <program> [arguments...]
//       runs the program under the debug API; exits with its exit code
//   repl_logview [--prefix <text>] --pid <process id>
//       attaches to a running process until it exits (its exit code) or
//       Ctrl+C detaches (0); the process goes on running either way
//
// Each debug string is printed as written, a line end added when it has
// none. The program keeps our console, stdin and stdout; exit code 255 means
// the viewer itself failed (bad arguments, program not started).
#include <windows.h>
#include <shellapi.h>

#include <cstdio>
#include <cwchar>
#include <string>
#include <vector>

#include "client/HostProcess.h"
#include "common/Raii.h"

namespace {

constexpr int kViewerFailed = 255;

HANDLE g_hStop = nullptr;  // set by Ctrl+C in attach mode

struct Arguments
{
    std::string strPrefix;
    DWORD dwPid = 0;
    std::wstring strCommandLine;
};

void WriteOut(const std::string& str)
{
    DWORD cbWritten = 0;
    ::WriteFile(::GetStdHandle(STD_OUTPUT_HANDLE), str.data(), static_cast<DWORD>(str.size()), &cbWritten, nullptr);
}

BOOL WINAPI CtrlHandler(DWORD dwCtrlType)
{
    // The program shares our console and gets the same Ctrl+C; we stay to
    // show what it logs on its way out. Attached, Ctrl+C means "stop".
    if (dwCtrlType == CTRL_C_EVENT || dwCtrlType == CTRL_BREAK_EVENT) {
        if (g_hStop) ::SetEvent(g_hStop);
        return TRUE;
    }
    return FALSE;
}

int Usage()
{
    std::fputs("usage: repl_logview [--prefix <text>] <program> [arguments...]\n"
               "       repl_logview [--prefix <text>] --pid <process id>\n",
               stderr);
    return kViewerFailed;
}

bool ParseArguments(Arguments& args)
{
    int argc = 0;
    LPWSTR* argv = ::CommandLineToArgvW(::GetCommandLineW(), &argc);
    if (argv == nullptr) return false;
    int i = 1;
    for (; i < argc && argv[i][0] == L'-'; ++i) {
        std::wstring strOption = argv[i];
        if (strOption == L"--prefix" && i + 1 < argc) {
            args.strPrefix = WideToUtf8(argv[++i]);
        } else if (strOption == L"--pid" && i + 1 < argc) {
            args.dwPid = static_cast<DWORD>(std::wcstoul(argv[++i], nullptr, 10));
        } else {
            break;
        }
    }
    for (; i < argc; ++i) args.strCommandLine += (args.strCommandLine.empty() ? L"" : L" ") + QuoteArg(argv[i]);
    ::LocalFree(argv);
    return (args.dwPid != 0) != !args.strCommandLine.empty();
}

void ShowLine(const std::string& strPrefix, const std::string& strLine)
{
    bool bEnded = !strLine.empty() && strLine.back() == '\n';
    WriteOut(strPrefix + strLine + (bEnded ? "" : "\n"));
}

}  // namespace

int main()
{
    Arguments args;
    if (!ParseArguments(args)) return Usage();
    HostOptions options;
    options.bDebug = true;
    options.bNewProcessGroup = false;
    options.bShareStdin = true;
    options.strCommandLine = args.strCommandLine;
    options.fnDebugLine = [&args](const std::string& strLine) { ShowLine(args.strPrefix, strLine); };

    CHandle hStop(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    g_hStop = args.dwPid ? hStop.Get() : nullptr;
    ::SetConsoleCtrlHandler(CtrlHandler, TRUE);

    CHostProcess program;
    HRESULT hr = args.dwPid ? program.Attach(args.dwPid, options) : program.Start(options);
    if (FAILED(hr)) {
        std::fprintf(stderr, "repl_logview: cannot %s (0x%08lX)\n", args.dwPid ? "attach" : "start the program",
                     static_cast<unsigned long>(hr));
        return kViewerFailed;
    }
    HANDLE hWaits[] = {program.ProcessHandle(), hStop.Get()};
    if (::WaitForMultipleObjects(2, hWaits, FALSE, INFINITE) == WAIT_OBJECT_0 + 1) {
        program.Detach();
        return 0;
    }
    std::optional<DWORD> dwExitCode = program.WaitForExit(INFINITE, false);
    return dwExitCode ? static_cast<int>(*dwExitCode) : kViewerFailed;
}
