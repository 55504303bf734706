// Faults and bad input across processes: a client whose Print fails in the
// middle of a flush, a client killed in the middle of a command, of an input
// request and of a flush, an interrupt pipe flooded with single bytes and
// with large writes, client texts that are random, truncated or damaged
// marshalling packets, and output from a Python thread after the run ended.
// Nothing may crash or hang, and nothing printed before a failure is lost.
#include <gtest/gtest.h>

#include <windows.h>
#include <process.h>

#include <algorithm>
#include <cstdio>
#include <cwchar>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "client/ReplClient.h"

namespace {

constexpr DWORD kTimeoutMs = 20000;
// A run that must end through the watchdog takes up to two of its polls.
constexpr DWORD kWatchdogTimeoutMs = 30000;
constexpr HRESULT kClientUnavailable = static_cast<HRESULT>(0x800706BA);
const std::string kLogPrefix = "ERROR [DeDazaRuvida]: ";

std::wstring HostCommand()
{
    return QuoteArg(ProgramDirectory() + L"\\repl_testhost.exe");
}

std::vector<std::string> LogLines(CHostProcess& host)
{
    std::vector<std::string> vecLines;
    for (const auto& strLine : host.Lines()) {
        if (strLine.rfind(kLogPrefix, 0) == 0) vecLines.push_back(strLine.substr(kLogPrefix.size()));
    }
    for (auto& strLine : vecLines) {
        if (!strLine.empty() && strLine.back() == '\n') strLine.pop_back();
    }
    return vecLines;
}

size_t CountOf(const std::vector<std::string>& vecLines, const std::string& strLine)
{
    return static_cast<size_t>(std::count(vecLines.begin(), vecLines.end(), strLine));
}

// The lines that are not in the allowed set, for the failure message.
std::vector<std::string> Unexpected(const std::vector<std::string>& vecLines,
                                    const std::vector<std::string>& vecAllowed)
{
    std::vector<std::string> vecOthers;
    for (const auto& strLine : vecLines) {
        if (std::find(vecAllowed.begin(), vecAllowed.end(), strLine) == vecAllowed.end()) vecOthers.push_back(strLine);
    }
    return vecOthers;
}

std::string Joined(const std::vector<std::string>& vecLines)
{
    std::string str;
    for (const auto& strLine : vecLines) str += "[" + strLine + "] ";
    return str;
}

// True when the "t<thread> <line>" texts keep each thread's order and start
// at line 0 of each thread; *pnTotal receives how many there were.
bool ThreadOrderKept(const std::vector<CReplClientObject::Call>& vecPrints, int nThreads, size_t* pnTotal)
{
    std::vector<int> vecNext(static_cast<size_t>(nThreads), 0);
    size_t nTotal = 0;
    for (const auto& call : vecPrints) {
        int nThread = -1, nLine = -1;
        if (std::swscanf(call.strText.c_str(), L"t%d %d", &nThread, &nLine) != 2) continue;
        if (nThread < 0 || nThread >= nThreads || nLine != vecNext[static_cast<size_t>(nThread)]++) return false;
        ++nTotal;
    }
    *pnTotal = nTotal;
    return true;
}

class Session : public ::testing::Test
{
protected:
    void SetUp() override { ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED); }
    void TearDown() override
    {
        m_spServer.Release();
        ::CoUninitialize();
    }

    void Start(const std::wstring& strExtraArgs = L"")
    {
        SessionOptions options;
        options.strHostCommand = HostCommand();
        options.strExtraArgs = strExtraArgs;
        options.host.bDebug = true;
        options.host.bCaptureOutput = true;
        ASSERT_EQ(m_session.Start(options), S_OK);
        ASSERT_TRUE(m_session.WaitConnected(kTimeoutMs)) << "the server never connected";
        m_spServer = m_session.Server();
    }

    // Waits for the host to end (through Quit when still connected) and
    // checks that the run ended with 0.
    void ExpectRunEndsWithZero()
    {
        m_spServer.Release();
        auto exitCode = m_session.Finish(kTimeoutMs);
        ASSERT_TRUE(exitCode.has_value()) << "the host did not exit";
        EXPECT_EQ(*exitCode, 0u);
        EXPECT_NE(m_session.Host().Output().find("KxReplRun returned 0"), std::string::npos);
    }

    std::vector<CReplClientObject::Call> Prints()
    {
        return m_session.Client().CallsOf(CReplClientObject::DISPID_PRINT);
    }

    CReplSession m_session;
    CComPtr<IDispatch> m_spServer;
};

}  // namespace

// ---- the client's Print fails in the middle of a flush ---------------------------------

namespace {

struct PrintFailure
{
    const wchar_t* pszCommand;  // print-then-flush: flushed inside the command; print-threads: by the main loop
    HRESULT hr;
    const char* pszName;
};

class PrintFailsMidFlush : public Session, public ::testing::WithParamInterface<PrintFailure>
{
};

constexpr int kThreads = 4, kLinesEach = 50, kFailFromCall = 51;

}  // namespace

TEST_P(PrintFailsMidFlush, LosesNothingSentBeforeTheFailure)
{
    Start();
    const PrintFailure& failure = GetParam();
    m_session.Client().SetResult(CReplClientObject::DISPID_PRINT, failure.hr, kFailFromCall);
    const bool bInCommand = std::wstring(failure.pszCommand) == L"print-then-flush";
    CallResult result = CallExec(m_spServer, failure.pszCommand, L"4 50");

    if (failure.hr == kClientUnavailable) {
        // The server quits at the failed call: nothing after it is sent, the
        // client is detached, and the command still returns to the client.
        EXPECT_EQ(result.hr, S_OK);
        ASSERT_TRUE(PumpWait(m_session.Client().DetachedEvent(), kTimeoutMs)) << "the client was not detached";
        ExpectRunEndsWithZero();
        auto vecPrints = Prints();
        EXPECT_EQ(vecPrints.size(), static_cast<size_t>(kFailFromCall));
        size_t nTotal = 0;
        EXPECT_TRUE(ThreadOrderKept(vecPrints, kThreads, &nTotal));
        EXPECT_EQ(nTotal, static_cast<size_t>(kFailFromCall));
        EXPECT_EQ(LogLines(m_session.Host()), std::vector<std::string>{"Client is unavailable, quitting"});
        return;
    }
    // Any other failure: every record is still sent, once, in order; a
    // command that flushed returns the failure, and the server goes on.
    size_t nExpected = kThreads * kLinesEach + (bInCommand ? 1 : 0);
    ASSERT_TRUE(PumpUntil([&] { return Prints().size() >= nExpected; }, kTimeoutMs));
    EXPECT_EQ(result.Effective(), bInCommand ? failure.hr : S_OK) << DescribeHResult(result.Effective()).c_str();
    auto vecPrints = Prints();
    size_t nTotal = 0;
    EXPECT_TRUE(ThreadOrderKept(vecPrints, kThreads, &nTotal));
    EXPECT_EQ(nTotal, static_cast<size_t>(kThreads * kLinesEach));
    if (bInCommand) {
        EXPECT_EQ(vecPrints.back().strText, L"flushed");
    }
    m_session.Client().SetResult(CReplClientObject::DISPID_PRINT, S_OK);
    CallResult after = CallExec(m_spServer, L"echo", L"after");
    EXPECT_EQ(after.hr, S_OK) << "the next command does not start clean";
    EXPECT_EQ(after.Text(), L"after");
    ExpectRunEndsWithZero();
    auto vecLines = LogLines(m_session.Host());
    EXPECT_EQ(vecLines.size(), nExpected - (kFailFromCall - 1));
    EXPECT_EQ(CountOf(vecLines, "Client call of Print failed"), vecLines.size()) << Joined(vecLines);
}

INSTANTIATE_TEST_SUITE_P(Faults, PrintFailsMidFlush,
                         ::testing::Values(PrintFailure{L"print-then-flush", E_FAIL, "EFailInsideACommand"},
                                           PrintFailure{L"print-threads", E_FAIL, "EFailInTheMainLoop"},
                                           PrintFailure{L"print-then-flush", kClientUnavailable,
                                                        "UnavailableInsideACommand"},
                                           PrintFailure{L"print-threads", kClientUnavailable,
                                                        "UnavailableInTheMainLoop"}),
                         [](const ::testing::TestParamInfo<PrintFailure>& info) { return info.param.pszName; });

// ---- the client is killed in the middle of something -------------------------------------

// A client that dies while the server is busy with it: a second copy of this
// program, killed by the test once it reports where it is. It tells the test
// what it received on its output, so that the test knows it arrived.
namespace {

// Longer than any test waits for us, so that a client left behind by a
// failed test still goes away.
constexpr DWORD kDyingClientWaitMs = 60000;

void Report(const std::string& strLine)
{
    std::printf("%s\n", strLine.c_str());
    std::fflush(stdout);
}

int RunDyingClient(const std::string& strMode)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CReplSession session;
    SessionOptions options;
    options.strHostCommand = HostCommand();
    if (FAILED(session.Start(options)) || !session.WaitConnected(kTimeoutMs)) return 3;
    CReplClientObject& client = session.Client();
    int nPrints = 0;
    client.SetPrintHandler([&](const std::wstring& strText, bool) {
        Report("got " + WideToUtf8(strText.substr(0, strText.find(L'\n'))));
        if (strMode == "flush" && ++nPrints == 10) {
            Report("blocked");
            ::Sleep(kDyingClientWaitMs);  // in the middle of the flush, until killed
        }
    });
    client.SetInputHandler([](const std::wstring&) {
        Report("blocked");
        ::Sleep(kDyingClientWaitMs);  // in the middle of the input request, until killed
        return CInputAnswer::NoInput();
    });
    Report("host " + std::to_string(session.Host().ProcessId()));
    CComPtr<IDispatch> spServer = session.Server();
    if (strMode == "command") {
        CallExec(spServer, L"print", L"before");
        Report("running");
        CallExec(spServer, L"spin", L"60000");
    } else if (strMode == "input") {
        CallExec(spServer, L"input", L"name? ");
    } else {
        CallExec(spServer, L"print-then-flush", L"2 100");
    }
    PumpFor(kDyingClientWaitMs);  // never reached in time: the test kills us
    return 0;
}

struct ClientDeath
{
    const char* pszMode;
    std::vector<std::string> vecRequired;  // log lines that must appear, once each
};

// The "got t<thread> <line>" reports keep each thread's order from line 0.
bool ReportedInThreadOrder(const std::string& strOut, int nThreads, size_t* pnLines)
{
    std::vector<int> vecNext(static_cast<size_t>(nThreads), 0);
    size_t nLines = 0;
    for (size_t nAt = strOut.find("got t"); nAt != std::string::npos; nAt = strOut.find("got t", nAt + 1)) {
        int nThread = -1, nLine = -1;
        if (std::sscanf(strOut.c_str() + nAt, "got t%d %d", &nThread, &nLine) != 2) return false;
        if (nThread < 0 || nThread >= nThreads || nLine != vecNext[static_cast<size_t>(nThread)]++) return false;
        ++nLines;
    }
    *pnLines = nLines;
    return true;
}

// Ends a child that a failed assertion left running.
class CKillAtExit
{
public:
    explicit CKillAtExit(CHostProcess& process) : m_process(process) {}
    CKillAtExit(const CKillAtExit&) = delete;
    CKillAtExit& operator=(const CKillAtExit&) = delete;
    ~CKillAtExit()
    {
        if (!m_process.HasExited()) m_process.Kill();
    }

private:
    CHostProcess& m_process;
};

class ClientKilled : public ::testing::TestWithParam<ClientDeath>
{
protected:
    void SetUp() override { ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED); }
    void TearDown() override { ::CoUninitialize(); }
};

}  // namespace

TEST_P(ClientKilled, RunEndsWithZeroAndKeepsWhatArrived)
{
    const ClientDeath& death = GetParam();
    HostOptions clientOptions;
    clientOptions.strCommandLine = QuoteArg(ProgramDirectory() + L"\\faults_test.exe") + L" --dying-client " +
                                   Utf8ToWide(death.pszMode);
    clientOptions.bCaptureOutput = true;
    CHostProcess client;
    ASSERT_EQ(client.Start(clientOptions), S_OK);
    CKillAtExit killClient(client);
    unsigned long nHostPid = 0;
    const std::string strReady = std::string(death.pszMode) == "command" ? "running" : "blocked";
    ASSERT_TRUE(PumpUntil(
        [&] {
            std::string strOut = client.Output();
            size_t nHost = strOut.find("host ");
            return nHost != std::string::npos && std::sscanf(strOut.c_str() + nHost, "host %lu", &nHostPid) == 1 &&
                   strOut.find(strReady) != std::string::npos;
        },
        kTimeoutMs))
        << client.Output();
    if (strReady == "running") ::Sleep(300);  // the spin has started
    CHostProcess host;
    ASSERT_EQ(host.Attach(nHostPid), S_OK);
    client.Kill(9);
    auto exitCode = host.WaitForExit(kWatchdogTimeoutMs);
    ASSERT_TRUE(exitCode.has_value()) << "the host outlived its client";
    EXPECT_EQ(*exitCode, 0u);

    // What the client reported before it died arrived whole and in order.
    std::string strOut = client.Output();
    if (std::string(death.pszMode) == "command") {
        EXPECT_NE(strOut.find("got before"), std::string::npos) << strOut;
    }
    if (std::string(death.pszMode) == "flush") {
        size_t nLines = 0;
        EXPECT_TRUE(ReportedInThreadOrder(strOut, 2, &nLines)) << strOut;
        EXPECT_EQ(nLines, 10u) << strOut;
    }
    auto vecLines = LogLines(host);
    for (const auto& strRequired : death.vecRequired) {
        EXPECT_EQ(CountOf(vecLines, strRequired), 1u) << strRequired << " in " << Joined(vecLines);
    }
    const std::vector<std::string> vecAllowed = {"Client call of Print failed",
                                                 "Client call of GetUserInput failed",
                                                 "Client is unavailable, quitting",
                                                 "Client call of Detach failed",
                                                 "Client process unavailable, stopping all threads"};
    EXPECT_TRUE(Unexpected(vecLines, vecAllowed).empty()) << Joined(vecLines);
}

INSTANTIATE_TEST_SUITE_P(
    Faults, ClientKilled,
    ::testing::Values(ClientDeath{"command", {"Client process unavailable, stopping all threads"}},
                      ClientDeath{"input", {}},
                      ClientDeath{"flush", {"Client is unavailable, quitting"}}),
    [](const ::testing::TestParamInfo<ClientDeath>& info) {
        return std::string("InTheMiddleOfA_") + info.param.pszMode;
    });

// ---- the interrupt pipe is flooded -----------------------------------------------------

namespace {

// Writes chunks to the pipe on a helper thread, so that a write the host
// never reads (its reader has ended, the pipe is full) cannot hang the test.
struct WriteJob
{
    HANDLE hPipe;
    std::vector<std::string> vecChunks;
    size_t nWritten = 0;
};

unsigned __stdcall WriteJobProc(void* pvJob)
{
    WriteJob* pJob = static_cast<WriteJob*>(pvJob);
    for (const auto& strChunk : pJob->vecChunks) {
        DWORD cbWritten = 0;
        if (!::WriteFile(pJob->hPipe, strChunk.data(), static_cast<DWORD>(strChunk.size()), &cbWritten, nullptr) ||
            cbWritten != strChunk.size()) {
            break;
        }
        ++pJob->nWritten;
    }
    return 0;
}

// Writes each chunk in one WriteFile; gives how many were written whole
// within the time (the rest is cancelled).
size_t WriteChunks(HANDLE hPipe, std::vector<std::string> vecChunks, DWORD dwMs)
{
    WriteJob* pJob = new WriteJob{hPipe, std::move(vecChunks)};
    CHandle hThread(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, WriteJobProc, pJob, 0, nullptr)));
    if (!hThread) {
        delete pJob;
        return 0;
    }
    if (!PumpWait(hThread.Get(), dwMs)) {
        // A write that nobody reads blocks: cancel it, repeatedly, since the
        // thread may be between two writes.
        for (int i = 0; i < 100 && !PumpWait(hThread.Get(), 50); ++i) ::CancelSynchronousIo(hThread.Get());
    }
    if (::WaitForSingleObject(hThread.Get(), 0) != WAIT_OBJECT_0) {
        ADD_FAILURE() << "a write to the pipe could not be cancelled";
        return 0;  // the job stays allocated: the thread may still use it
    }
    size_t nWritten = pJob->nWritten;
    delete pJob;
    return nWritten;
}

std::vector<std::string> SingleBytes(char ch, size_t nCount)
{
    return std::vector<std::string>(nCount, std::string(1, ch));
}

class PipeFlood : public Session
{
protected:
    // Waits until the host has read everything written so far, or has
    // stopped reading: the pipe buffers about 4 KB, so a write returns long
    // before its bytes are read. The host's copy of the read end (its value
    // ends our command line) is duplicated to look into the pipe.
    bool WaitUntilHostDoneReading()
    {
        const std::wstring& strCommandLine = m_session.CommandLine();
        ULONG_PTR nRemote = std::wcstoull(strCommandLine.c_str() + strCommandLine.find_last_of(L' ') + 1, nullptr, 10);
        CHandle hHost(::OpenProcess(PROCESS_DUP_HANDLE, FALSE, m_session.Host().ProcessId()));
        HANDLE hRead = nullptr;
        if (!hHost || !::DuplicateHandle(hHost.Get(), reinterpret_cast<HANDLE>(nRemote), ::GetCurrentProcess(), &hRead,
                                         0, FALSE, DUPLICATE_SAME_ACCESS)) {
            return false;
        }
        CHandle hOwnedRead(hRead);
        bool bDone = PumpUntil(
            [&] {
                DWORD cbAvailable = 1;
                bool bDrained = ::PeekNamedPipe(hRead, nullptr, 0, nullptr, &cbAvailable, nullptr) && cbAvailable == 0;
                return bDrained || ChannelEnded();
            },
            kTimeoutMs, 1);
        PumpFor(200);  // the last read is dispatched, and its log line (if any) arrives
        return bDone;
    }

    // The pipe may have ended the interrupt channel (a read that returned a
    // full buffer); either way the server serves commands, and an interrupt
    // works exactly when the channel is still there.
    void ExpectServerStillServes()
    {
        ASSERT_TRUE(WaitUntilHostDoneReading()) << "the host neither reads the pipe nor reported why";
        CallResult echo = CallExec(m_spServer, L"echo", L"still here");
        EXPECT_EQ(echo.hr, S_OK);
        EXPECT_EQ(echo.Text(), L"still here");
        bool bChannelEnded = ChannelEnded();
        CallResult spin = SpinWithInterrupt();
        EXPECT_EQ(spin.Effective(), bChannelEnded ? S_OK : E_ABORT) << DescribeHResult(spin.Effective()).c_str();
    }

    bool ChannelEnded() { return CountOf(LogLines(m_session.Host()), "Error reading from interrupt pipe") > 0; }

    // A spin of two seconds with an interrupt written into it.
    CallResult SpinWithInterrupt()
    {
        HANDLE hPipe = m_session.Pipe().WriteHandle();
        CHandle hThread(
            reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, DelayedInterruptProc, hPipe, 0, nullptr)));
        CallResult spin = CallExec(m_spServer, L"spin", L"2000");
        if (hThread) PumpWait(hThread.Get(), kTimeoutMs);
        return spin;
    }

    static unsigned __stdcall DelayedInterruptProc(void* pvPipe)
    {
        ::Sleep(300);
        DWORD cbWritten = 0;
        char ch = 'a';
        // The pipe holds it when the reader is gone, so this never blocks long.
        ::WriteFile(static_cast<HANDLE>(pvPipe), &ch, 1, &cbWritten, nullptr);
        return 0;
    }
};

}  // namespace

TEST_F(PipeFlood, ThousandsOfSingleInterruptsWhileIdle)
{
    Start();
    EXPECT_EQ(WriteChunks(m_session.Pipe().WriteHandle(), SingleBytes('a', 3000), kTimeoutMs), 3000u);
    ExpectServerStillServes();
    ExpectRunEndsWithZero();
    auto vecLines = LogLines(m_session.Host());
    EXPECT_LE(vecLines.size(), 1u) << Joined(vecLines);
    EXPECT_TRUE(Unexpected(vecLines, {"Error reading from interrupt pipe"}).empty()) << Joined(vecLines);
}

TEST_F(PipeFlood, ThousandsOfSingleInterruptsDuringACommand)
{
    Start();
    HANDLE hPipe = m_session.Pipe().WriteHandle();
    size_t nWritten = 0;
    CHandle hDone(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    std::thread writer([&] {
        ::Sleep(200);
        nWritten = WriteChunks(hPipe, SingleBytes('a', 3000), kTimeoutMs);
        ::SetEvent(hDone.Get());
    });
    CallResult spin = CallExec(m_spServer, L"spin", L"20000");
    PumpWait(hDone.Get(), 2 * kTimeoutMs);
    writer.join();
    EXPECT_EQ(nWritten, 3000u);
    EXPECT_EQ(spin.Effective(), E_ABORT);
    ExpectServerStillServes();
    ExpectRunEndsWithZero();
    auto vecLines = LogLines(m_session.Host());
    EXPECT_LE(vecLines.size(), 1u) << Joined(vecLines);
    EXPECT_TRUE(Unexpected(vecLines, {"Error reading from interrupt pipe"}).empty()) << Joined(vecLines);
}

TEST_F(PipeFlood, ThousandsOfUnknownBytesAreEachReportedAndSkipped)
{
    Start();
    constexpr size_t kBytes = 2000;
    EXPECT_EQ(WriteChunks(m_session.Pipe().WriteHandle(), SingleBytes('x', kBytes), kTimeoutMs), kBytes);
    ExpectServerStillServes();
    ExpectRunEndsWithZero();
    // Bytes that arrive together are one read and one line.
    auto vecLines = LogLines(m_session.Host());
    size_t nUnknown = CountOf(vecLines, "Interrupt: unknown command");
    EXPECT_GE(nUnknown, 1u);
    EXPECT_LE(nUnknown, kBytes);
    EXPECT_LE(CountOf(vecLines, "Error reading from interrupt pipe"), 1u);
    EXPECT_TRUE(Unexpected(vecLines, {"Interrupt: unknown command", "Error reading from interrupt pipe"}).empty())
        << Joined(vecLines);
}

TEST_F(PipeFlood, LargeWritesEndTheInterruptChannelOnly)
{
    Start();
    // The first read returns a full buffer: the channel ends with one line,
    // and nothing reads the rest, so later writes may not complete.
    WriteChunks(m_session.Pipe().WriteHandle(), {std::string(1024, 'a')}, 2000);
    ASSERT_TRUE(m_session.Host().WaitForLine("Error reading from interrupt pipe", kTimeoutMs));
    WriteChunks(m_session.Pipe().WriteHandle(), std::vector<std::string>(3, std::string(4096, 'a')), 2000);
    ExpectServerStillServes();
    ExpectRunEndsWithZero();
    EXPECT_EQ(LogLines(m_session.Host()), std::vector<std::string>{"Error reading from interrupt pipe"});
}

// ---- bad client texts --------------------------------------------------------------------

namespace {

// How a run with a given client text ended.
struct TextOutcome
{
    std::optional<DWORD> exitCode;  // none: the host hung and was ended
    std::vector<std::string> vecLog;
    bool bConnected = false;  // the text named our client after all
    std::string strOutput;
};

TextOutcome RunWithText(const std::string& strText, CReplClientObject* pClient = nullptr)
{
    TextOutcome outcome;
    CReplSession session;
    SessionOptions options;
    options.strHostCommand = HostCommand();
    options.host.bDebug = true;
    options.host.bCaptureOutput = true;
    options.strClientTextOverride = strText;
    if (FAILED(session.Start(options, pClient))) return outcome;
    HANDLE rghWaits[] = {session.Host().ProcessHandle(), session.Client().ConnectedEvent()};
    DWORD dwWait = PumpWaitAny(rghWaits, 2, kTimeoutMs);
    outcome.bConnected = session.Client().IsConnected();
    // Neither ended nor connected in that time: a hang, not worth waiting for.
    if (dwWait != WAIT_TIMEOUT) outcome.exitCode = session.Finish(kTimeoutMs);
    if (!outcome.exitCode) session.Host().Kill();
    outcome.vecLog = LogLines(session.Host());
    outcome.strOutput = session.Host().Output();
    return outcome;
}

std::string Describe(const std::string& strText, const TextOutcome& outcome)
{
    return "text \"" + strText + "\": exit " + (outcome.exitCode ? std::to_string(*outcome.exitCode) : "none") +
           ", log " + Joined(outcome.vecLog);
}

// Refused at the attach: result 2 and the one line of the unmarshalling.
bool IsRefused(const TextOutcome& outcome)
{
    return outcome.exitCode == 2u && outcome.vecLog == std::vector<std::string>{"Cannot unmarshal client interface"};
}

// Read, but what it names does not answer: Connect fails, so does Init.
bool IsUnreachable(const TextOutcome& outcome)
{
    return outcome.exitCode == 3u &&
           outcome.vecLog == std::vector<std::string>{"Client call of Connect failed", "Cannot Init server object"};
}

// It named our client after all: a whole run, ended by Quit.
bool IsNormalRun(const TextOutcome& outcome)
{
    return outcome.bConnected && outcome.exitCode == 0u && outcome.vecLog.empty();
}

const char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

class BadClientText : public ::testing::Test
{
protected:
    void SetUp() override { ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED); }
    void TearDown() override { ::CoUninitialize(); }
};

}  // namespace

TEST_F(BadClientText, RandomTextIsRefused)
{
    std::mt19937 random(20240607);  // fixed: the same texts every run
    for (int i = 0; i < 12; ++i) {
        size_t cch = 8 + random() % 150;
        std::string strText;
        for (size_t n = 0; n < cch; ++n) strText += kAlphabet[random() % 64];
        TextOutcome outcome = RunWithText(strText);
        ASSERT_TRUE(outcome.exitCode.has_value()) << "the host did not exit; its output: " << outcome.strOutput;
        EXPECT_TRUE(IsRefused(outcome)) << Describe(strText, outcome);
    }
}

// A fresh client and its text for each run: ending a session disconnects
// the client, and with it every packet that names it.
TextOutcome RunWithTruncatedText(size_t cch)
{
    auto spClient = CReplClientObject::Create();
    std::string strText = MarshalToBase64(spClient);
    EXPECT_GE(strText.size(), 88u);
    TextOutcome outcome = RunWithText(strText.substr(0, cch), spClient);
    spClient->DisconnectRemotes();
    return outcome;
}

TEST_F(BadClientText, TruncatedTextIsRefused)
{
    // Cut in the part that names the object (its first 64 bytes: up to 84
    // characters give at most 63), the packet cannot be read.
    for (size_t cch : {4u, 8u, 12u, 20u, 32u, 44u, 56u, 68u, 80u, 84u}) {
        TextOutcome outcome = RunWithTruncatedText(cch);
        ASSERT_TRUE(outcome.exitCode.has_value()) << cch << " characters: the host did not exit; its output: "
                                                  << outcome.strOutput;
        EXPECT_TRUE(IsRefused(outcome)) << cch << " characters: " << Describe("", outcome);
    }
    // Cut in the resolver address, it may still name our client.
    TextOutcome outcome = RunWithTruncatedText(88);
    ASSERT_TRUE(outcome.exitCode.has_value()) << "88 characters: the host did not exit; its output: "
                                              << outcome.strOutput;
    EXPECT_TRUE(IsRefused(outcome) || IsNormalRun(outcome)) << "88 characters: " << Describe("", outcome);
}

namespace {

// What a damaged field may lead to. A field that names the object (where it
// lives, which interface pointer) can only be refused or lead to a client
// that does not answer; other fields may be ignored by the unmarshaller.
enum class Damage
{
    kRefused,               // result 2 and the unmarshalling's one line
    kRefusedOrUnreachable,  // that, or result 3: Connect fails, Init fails
    kAnyOutcome,            // one of those, or the run works normally
};

struct PacketField
{
    const char* pszName;
    size_t nOffset;  // the byte damaged, inside the field
    Damage damage;
};

// The fields of a standard marshalling packet (an OBJREF), one byte of each.
const PacketField kPacketFields[] = {
    {"signature", 1, Damage::kRefused},
    {"flags", 5, Damage::kAnyOutcome},
    {"interface id", 16, Damage::kRefused},
    {"reference flags", 25, Damage::kAnyOutcome},
    {"public references", 29, Damage::kAnyOutcome},
    {"exporter id", 36, Damage::kRefusedOrUnreachable},
    {"object id", 44, Damage::kAnyOutcome},
    {"interface pointer id", 56, Damage::kRefusedOrUnreachable},
    {"resolver address", 64, Damage::kAnyOutcome},
};

}  // namespace

TEST_F(BadClientText, DamagedPacketIsRefusedOrEndsTheRunCleanly)
{
    for (const PacketField& field : kPacketFields) {
        auto spClient = CReplClientObject::Create();
        std::vector<BYTE> vecPacket;
        ASSERT_TRUE(Base64DecodeStrict(MarshalToBase64(spClient), vecPacket));
        ASSERT_GT(vecPacket.size(), field.nOffset);
        vecPacket[field.nOffset] ^= 0x5A;
        std::string strText = Base64Encode(vecPacket.data(), vecPacket.size());
        TextOutcome outcome = RunWithText(strText, spClient);
        spClient->DisconnectRemotes();

        if (!outcome.exitCode) {
            ADD_FAILURE() << field.pszName << ": the host did not exit; its output: " << outcome.strOutput;
            continue;
        }
        bool bExpected = IsRefused(outcome);
        if (field.damage != Damage::kRefused) bExpected = bExpected || IsUnreachable(outcome);
        if (field.damage == Damage::kAnyOutcome) bExpected = bExpected || IsNormalRun(outcome);
        EXPECT_TRUE(bExpected) << field.pszName << ": " << Describe(strText, outcome);
    }
}

// ---- output from a Python thread after the run ended -------------------------------------

namespace {

// The "storm <i>" lines a client received: true when they are a run of
// consecutive numbers; gives the first and the count.
bool ConsecutiveStormLines(const std::vector<CReplClientObject::Call>& vecPrints, long* pnFirst, long* pnCount)
{
    long nFirst = -1, nCount = 0;
    for (const auto& call : vecPrints) {
        long nLine = -1;
        if (std::swscanf(call.strText.c_str(), L"storm %ld", &nLine) != 1) continue;
        if (nFirst < 0) nFirst = nLine;
        if (nLine != nFirst + nCount) return false;
        ++nCount;
    }
    *pnFirst = nFirst;
    *pnCount = nCount;
    return true;
}

long StormTotal(const std::string& strOutput)
{
    size_t nAt = strOutput.find("storm printed ");
    long nTotal = -1;
    if (nAt != std::string::npos) std::sscanf(strOutput.c_str() + nAt, "storm printed %ld", &nTotal);
    return nTotal;
}

}  // namespace

TEST_F(Session, ThreadPrintingAcrossTheEndOfTheRunIsCutCleanly)
{
    Start();
    ASSERT_EQ(CallExec(m_spServer, L"print-storm", L"1500").hr, S_OK);
    PumpFor(100);  // some lines reach the client first
    ExpectRunEndsWithZero();
    long nTotal = StormTotal(m_session.Host().Output());
    long nFirst = -1, nCount = 0;
    EXPECT_TRUE(ConsecutiveStormLines(Prints(), &nFirst, &nCount));
    EXPECT_EQ(nFirst, 0);
    EXPECT_GT(nCount, 0);
    // Most lines were printed after the run ended: dropped, not sent.
    EXPECT_GT(nTotal, nCount) << m_session.Host().Output();
    EXPECT_TRUE(LogLines(m_session.Host()).empty()) << Joined(LogLines(m_session.Host()));
}

TEST_F(Session, ThreadPrintingFromOneRunIntoTheNextReachesEachClientInOrder)
{
    // The second run needs a marshalling packet of its own.
    auto spSecond = CReplClientObject::Create();
    std::string strSecond = MarshalToBase64(spSecond);
    Start(L"--runs 2 --next-text " + Utf8ToWide(strSecond));
    ASSERT_EQ(CallExec(m_spServer, L"print-storm", L"3000").hr, S_OK);
    PumpFor(100);
    EXPECT_EQ(CallQuit(m_spServer).hr, S_OK);
    ASSERT_TRUE(PumpWait(spSecond->ConnectedEvent(), kTimeoutMs)) << "the second run never connected";
    CComPtr<IDispatch> spServer2 = spSecond->Server();
    PumpFor(300);  // lines of the storm reach the second client
    EXPECT_EQ(CallExec(spServer2, L"echo", L"second").Text(), L"second");
    EXPECT_EQ(CallQuit(spServer2).hr, S_OK);
    spServer2.Release();
    m_spServer.Release();
    auto exitCode = m_session.Finish(kTimeoutMs);
    ASSERT_TRUE(exitCode.has_value()) << "the host did not exit";
    EXPECT_EQ(*exitCode, 0u);

    long nFirst1 = -1, nCount1 = 0, nFirst2 = -1, nCount2 = 0;
    EXPECT_TRUE(ConsecutiveStormLines(Prints(), &nFirst1, &nCount1));
    EXPECT_TRUE(ConsecutiveStormLines(spSecond->CallsOf(CReplClientObject::DISPID_PRINT), &nFirst2, &nCount2));
    EXPECT_EQ(nFirst1, 0);
    EXPECT_GT(nCount2, 0);
    EXPECT_GE(nFirst2, nFirst1 + nCount1) << "a line reached both clients";
    EXPECT_GT(StormTotal(m_session.Host().Output()), nFirst2 + nCount2);
    EXPECT_TRUE(LogLines(m_session.Host()).empty()) << Joined(LogLines(m_session.Host()));
    spSecond->DisconnectRemotes();
}

int main(int argc, char** argv)
{
    if (argc >= 3 && std::string(argv[1]) == "--dying-client") return RunDyingClient(argv[2]);
    ::testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
