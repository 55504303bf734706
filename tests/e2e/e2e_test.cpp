// The whole server across processes: this program is the client; the test
// host (repl_testhost.exe, a stand-in for python.exe) loads ReplServer.dll
// and runs KxReplRun under our debugger, so that its log is captured.
#include <gtest/gtest.h>

#include <windows.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "client/ReplClient.h"

namespace {

constexpr DWORD kTimeoutMs = 20000;
const std::string kLogPrefix = "ERROR [DeDazaRuvida]: ";

std::wstring ProgramDir()
{
    wchar_t szPath[MAX_PATH];
    DWORD cch = ::GetModuleFileNameW(nullptr, szPath, MAX_PATH);
    std::wstring str(szPath, cch);
    return str.substr(0, str.find_last_of(L"\\/"));
}

// REPL_E2E_HOST names another host program (the 32-bit one, for the x86
// smoke run); by default the host next to this program.
std::wstring HostCommand()
{
    wchar_t szHost[MAX_PATH];
    if (::GetEnvironmentVariableW(L"REPL_E2E_HOST", szHost, MAX_PATH) > 0) {
        return L"\"" + std::wstring(szHost) + L"\"";
    }
    return L"\"" + ProgramDir() + L"\\repl_testhost.exe\"";
}

// REPL_E2E_NO_DEBUG=1: the host's log cannot be read through the debug API
// (a 32-bit host under user-mode emulation); tests that need it skip.
bool CanReadHostLog()
{
    wchar_t szValue[8];
    return !(::GetEnvironmentVariableW(L"REPL_E2E_NO_DEBUG", szValue, 8) > 0 && szValue[0] == L'1');
}

std::vector<std::string> LogLines(CHostProcess& host)
{
    std::vector<std::string> vecLines;
    for (const auto& strLine : host.Lines()) {
        if (strLine.rfind(kLogPrefix, 0) == 0) vecLines.push_back(strLine);
    }
    return vecLines;
}

std::string Line(const std::string& strMessage)
{
    return kLogPrefix + strMessage + "\n";
}

VARIANT Int(int n)
{
    VARIANT var;
    ::VariantInit(&var);
    var.vt = VT_I4;
    var.lVal = n;
    return var;
}

class Session : public ::testing::Test
{
protected:
    void SetUp() override { ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED); }
    void TearDown() override { ::CoUninitialize(); }

    // Starts the host under the debugger and waits for Connect.
    void Start(const std::wstring& strExtraArgs = L"")
    {
        SessionOptions options;
        options.strHostCommand = HostCommand();
        options.strExtraArgs = strExtraArgs;
        options.host.bDebug = CanReadHostLog();
        options.host.bCaptureOutput = true;
        ASSERT_EQ(m_session.Start(options), S_OK);
        ASSERT_TRUE(m_session.WaitConnected(kTimeoutMs)) << "the server never connected";
    }

    IDispatch* Server() { m_spServer = m_session.Server(); return m_spServer; }

    // Ends the session through Quit and checks the run ended with 0.
    void FinishCleanly()
    {
        CallResult quit;
        auto exitCode = m_session.Finish(kTimeoutMs, &quit);
        ASSERT_TRUE(exitCode.has_value()) << "the host did not exit";
        EXPECT_EQ(*exitCode, 0u);
        EXPECT_NE(m_session.Host().Output().find("KxReplRun returned 0"), std::string::npos);
    }

    CReplSession m_session;
    CComPtr<IDispatch> m_spServer;
};

}  // namespace

TEST_F(Session, ExecReturnsTheResultByDispatchIdAndByName)
{
    Start();
    CallResult byId = CallExec(Server(), L"echo", L"hello");
    EXPECT_EQ(byId.hr, S_OK);
    EXPECT_EQ(byId.Text(), L"hello");
    CallResult byName = CallExec(Server(), L"echo", L"by name", true);
    EXPECT_EQ(byName.hr, S_OK);
    EXPECT_EQ(byName.Text(), L"by name");
    DISPID dispid = 0;
    for (auto [pszName, expected] : {std::pair<const wchar_t*, DISPID>{L"Exec", 1}, {L"ExecCom", 2}, {L"Quit", 3}}) {
        EXPECT_EQ(GetDispId(Server(), pszName, &dispid), S_OK);
        EXPECT_EQ(dispid, expected) << pszName;
    }
    FinishCleanly();
    EXPECT_TRUE(LogLines(m_session.Host()).empty());
}

TEST_F(Session, ExecComConvertsArgumentAndResult)
{
    Start();
    CallResult echo = CallExecCom(Server(), L"com-echo", Int(42));
    EXPECT_EQ(echo.hr, S_OK);
    EXPECT_EQ(echo.varResult.vt, VT_I4);
    EXPECT_EQ(echo.varResult.lVal, 42);
    CallResult unconvertible = CallExecCom(Server(), L"com-unconvertible", Int(1));
    EXPECT_EQ(unconvertible.Effective(), E_FAIL);
    CallResult failure = CallExecCom(Server(), L"com-fail", Int(1));
    EXPECT_EQ(failure.hr, DISP_E_EXCEPTION);
    EXPECT_EQ(failure.strDescription, L"com failure");
    CallResult stats = CallExec(Server(), L"stats", L"");
    EXPECT_EQ(stats.Text().substr(0, 7), L"live=0 ") << stats.Text();
    FinishCleanly();
}

TEST_F(Session, FailureTextArrivesInExcepInfo)
{
    Start();
    CallResult failure = CallExec(Server(), L"fail", L"Traceback: boom");
    EXPECT_EQ(failure.hr, DISP_E_EXCEPTION);
    EXPECT_EQ(failure.Effective(), DISP_E_EXCEPTION);
    EXPECT_EQ(failure.strDescription, L"Traceback: boom");
    CallResult bare = CallExec(Server(), L"fail", L"");
    EXPECT_EQ(bare.Effective(), DISP_E_EXCEPTION);
    EXPECT_TRUE(bare.strDescription.empty());
    FinishCleanly();
}

TEST_F(Session, OutputOfSeveralThreadsArrivesWholeAndInEachThreadsOrder)
{
    Start();
    constexpr int kThreads = 4, kLines = 50;
    CallResult result = CallExec(Server(), L"print-threads", L"4 50");
    ASSERT_EQ(result.hr, S_OK);
    ASSERT_TRUE(PumpUntil([&] { return m_session.Client().CountOf(CReplClientObject::DISPID_PRINT) >= kThreads * kLines; },
                          kTimeoutMs));
    std::vector<int> vecNext(kThreads, 0);
    for (const auto& call : m_session.Client().CallsOf(CReplClientObject::DISPID_PRINT)) {
        int nThread = 0, nLine = 0;
        ASSERT_EQ(swscanf(call.strText.c_str(), L"t%d %d", &nThread, &nLine), 2) << call.strText;
        ASSERT_EQ(nLine, vecNext[nThread]++) << "thread " << nThread << " out of order";
        EXPECT_EQ(call.nIsError, VARIANT_FALSE);
    }
    EXPECT_EQ(vecNext, std::vector<int>(kThreads, kLines));
    CallResult err = CallExec(Server(), L"eprint", L"to stderr");
    EXPECT_EQ(err.hr, S_OK);
    auto vecPrints = m_session.Client().CallsOf(CReplClientObject::DISPID_PRINT);
    EXPECT_EQ(vecPrints.back().strText, L"to stderr");
    EXPECT_EQ(vecPrints.back().nIsError, VARIANT_TRUE);
    FinishCleanly();
}

TEST_F(Session, InputReachesTheClientAndItsAnswerComesBack)
{
    Start();
    m_session.Client().QueueInput(CInputAnswer::Text(L"forty-two"));
    CallResult answered = CallExec(Server(), L"input", L"Your answer? ");
    EXPECT_EQ(answered.hr, S_OK);
    EXPECT_EQ(answered.Text(), L"forty-two");
    auto vecAsks = m_session.Client().CallsOf(CReplClientObject::DISPID_GETUSERINPUT);
    ASSERT_EQ(vecAsks.size(), 1u);
    EXPECT_EQ(vecAsks[0].strText, L"Your answer? ");
    m_session.Client().QueueInput(CInputAnswer::NoInput());
    CallResult eof = CallExec(Server(), L"input", L"more? ");
    EXPECT_EQ(eof.Effective(), DISP_E_EXCEPTION);
    EXPECT_EQ(eof.strDescription, L"EOFError");
    FinishCleanly();
}

TEST_F(Session, InterruptThroughThePipeAbortsARunningCommand)
{
    Start();
    std::thread sender([this] {
        ::Sleep(300);
        m_session.Pipe().Send('a');
    });
    CallResult spin = CallExec(Server(), L"spin", L"15000");
    sender.join();
    EXPECT_EQ(spin.Effective(), E_ABORT);
    // The next command starts clean.
    EXPECT_EQ(CallExec(Server(), L"echo", L"after").Text(), L"after");
    FinishCleanly();
    EXPECT_TRUE(LogLines(m_session.Host()).empty());
}

TEST_F(Session, KillCommandReachesEveryPythonThread)
{
    Start();
    ASSERT_EQ(CallExec(Server(), L"spin-threads", L"3").hr, S_OK);
    ::Sleep(200);  // the threads register with the interpreter
    ASSERT_TRUE(m_session.Pipe().Send('k'));
    ASSERT_TRUE(PumpUntil([&] { return m_session.Client().CountOf(CReplClientObject::DISPID_PRINT) >= 3; }, kTimeoutMs));
    std::wstring strOutput = m_session.Client().Output(false);
    for (int i = 0; i < 3; ++i) {
        EXPECT_NE(strOutput.find(L"thread " + std::to_wstring(i) + L" interrupted"), std::wstring::npos) << i;
    }
    FinishCleanly();
}

TEST_F(Session, NestedCallFromInsidePrintRunsAndReturns)
{
    Start();
    std::wstring strNested;
    m_session.Client().SetCallHook([&](const CReplClientObject::Call& call) -> std::optional<HRESULT> {
        if (call.dispid == CReplClientObject::DISPID_PRINT && call.strText == L"outer") {
            strNested = CallExec(m_spServer, L"echo", L"inner").Text();
        }
        return std::nullopt;
    });
    CallResult outer = CallExec(Server(), L"print", L"outer");
    EXPECT_EQ(outer.hr, S_OK);
    EXPECT_EQ(strNested, L"inner");
    FinishCleanly();
}

TEST_F(Session, QuitFromPythonDetachesTheClientAndEndsTheRun)
{
    Start();
    CallResult quit = CallExec(Server(), L"quit", L"");
    EXPECT_EQ(quit.hr, S_OK);
    EXPECT_EQ(quit.Text(), L"quit");
    EXPECT_TRUE(PumpWait(m_session.Client().DetachedEvent(), kTimeoutMs));
    FinishCleanly();
}

TEST_F(Session, QuitMessageFromPythonEndsTheRunAndDetachesTheClient)
{
    Start();
    EXPECT_EQ(CallExec(Server(), L"postquit", L"").hr, S_OK);
    EXPECT_TRUE(PumpWait(m_session.Client().DetachedEvent(), kTimeoutMs));
    FinishCleanly();
}

TEST_F(Session, TwoRunsOneAfterTheOtherInOneHost)
{
    // The second run needs a marshalling packet of its own.
    auto spSecond = CReplClientObject::Create();
    std::string strSecond = MarshalToBase64(spSecond);
    ASSERT_FALSE(strSecond.empty());
    Start(L"--runs 2 --next-text " + std::wstring(strSecond.begin(), strSecond.end()));
    EXPECT_EQ(CallExec(Server(), L"echo", L"first").Text(), L"first");
    EXPECT_EQ(CallQuit(Server()).hr, S_OK);
    ASSERT_TRUE(PumpWait(spSecond->ConnectedEvent(), kTimeoutMs)) << "second run never connected";
    CComPtr<IDispatch> spServer2 = spSecond->Server();
    EXPECT_EQ(CallExec(spServer2, L"echo", L"second").Text(), L"second");
    EXPECT_EQ(CallQuit(spServer2).hr, S_OK);
    spServer2.Release();
    auto exitCode = m_session.Finish(kTimeoutMs);
    ASSERT_TRUE(exitCode.has_value());
    EXPECT_EQ(*exitCode, 0u);
    std::string strOutput = m_session.Host().Output();
    EXPECT_EQ(std::count(strOutput.begin(), strOutput.end(), '\n') >= 2, true);
    EXPECT_NE(strOutput.find("KxReplRun returned 0\r\nKxReplRun returned 0"), std::string::npos) << strOutput;
    spSecond->DisconnectRemotes();
}

TEST_F(Session, FailedConnectEndsWithThreeAndTheNextRunStartsClean)
{
    if (!CanReadHostLog()) GTEST_SKIP() << "the host's log cannot be read here";
    auto spRefusing = CReplClientObject::Create();
    spRefusing->SetResult(CReplClientObject::DISPID_CONNECT, E_FAIL);
    auto spSecond = CReplClientObject::Create();
    std::string strSecond = MarshalToBase64(spSecond);
    SessionOptions options;
    options.strHostCommand = HostCommand();
    options.strExtraArgs = L"--runs 2 --next-text " + std::wstring(strSecond.begin(), strSecond.end());
    options.host.bDebug = true;
    options.host.bCaptureOutput = true;
    ASSERT_EQ(m_session.Start(options, spRefusing), S_OK);
    ASSERT_TRUE(PumpWait(spSecond->ConnectedEvent(), kTimeoutMs)) << "the second run never connected";
    CComPtr<IDispatch> spServer = spSecond->Server();
    EXPECT_EQ(CallExec(spServer, L"echo", L"clean").Text(), L"clean");
    EXPECT_EQ(CallQuit(spServer).hr, S_OK);
    spServer.Release();
    auto exitCode = m_session.Host().WaitForExit(kTimeoutMs);
    ASSERT_TRUE(exitCode.has_value());
    EXPECT_EQ(*exitCode, 0u);
    EXPECT_NE(m_session.Host().Output().find("KxReplRun returned 3\r\nKxReplRun returned 0"), std::string::npos)
        << m_session.Host().Output();
    EXPECT_EQ(LogLines(m_session.Host()),
              (std::vector<std::string>{Line("Client call of Connect failed"), Line("Cannot Init server object")}));
    spSecond->DisconnectRemotes();
}

// Argument and attach failures: result 1 or 2 and exactly one log line each.
struct StartFailure
{
    const wchar_t* pszArgs;
    const char* pszText;  // client text override, or null
    DWORD dwResult;
    const char* pszMessage;  // null: the failure is not logged
};

class StartFailures : public ::testing::TestWithParam<StartFailure>
{
protected:
    void SetUp() override { ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED); }
    void TearDown() override { ::CoUninitialize(); }
};

TEST_P(StartFailures, EndWithTheirResultAndOneLogLine)
{
    if (!CanReadHostLog()) GTEST_SKIP() << "the host's log cannot be read here";
    const StartFailure& failure = GetParam();
    CReplSession session;
    SessionOptions options;
    options.strHostCommand = HostCommand();
    options.strExtraArgs = failure.pszArgs;
    options.host.bDebug = true;
    options.host.bCaptureOutput = true;
    if (failure.pszText) options.strClientTextOverride = failure.pszText;
    ASSERT_EQ(session.Start(options), S_OK);
    auto exitCode = session.Host().WaitForExit(kTimeoutMs);
    ASSERT_TRUE(exitCode.has_value());
    EXPECT_EQ(*exitCode, failure.dwResult);
    std::vector<std::string> vecExpected;
    if (failure.pszMessage) vecExpected.push_back(Line(failure.pszMessage));
    EXPECT_EQ(LogLines(session.Host()), vecExpected);
    EXPECT_FALSE(session.Client().IsConnected());
}

INSTANTIATE_TEST_SUITE_P(
    Run, StartFailures,
    ::testing::Values(StartFailure{L"--null pszClient --null pid", nullptr, 1, "Invalid argument: pszClient"},
                      StartFailure{L"--null pid", nullptr, 1, "Invalid argument: dwClientPID"},
                      StartFailure{L"--null python", nullptr, 1, "Invalid argument: hPythonDLL"},
                      StartFailure{L"--invalid-pipe --null exec", nullptr, 1, "Invalid argument: hInterruptPipe"},
                      StartFailure{L"--null pipe", nullptr, 1, "Invalid argument: hInterruptPipe"},
                      StartFailure{L"--null exec", nullptr, 1, "Invalid argument: pExecProc"},
                      StartFailure{L"", "", 2, "Cannot decode client string"},
                      // Nothing decoded: the empty memory block cannot be locked.
                      StartFailure{L"", "= =", 2, nullptr},
                      StartFailure{L"", "QUJDREVGR0hJSktMTU5PUA==", 2, "Cannot unmarshal client interface"}));

// A client that dies: the watchdog notices within two polls, interrupts
// Python and ends the run with 0. The dying client is a second copy of this
// program; the host is attached to as a debugger to read its log.
namespace {

int RunDyingClient(const char* pszMode)
{
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    CReplSession session;
    SessionOptions options;
    options.strHostCommand = HostCommand();
    if (FAILED(session.Start(options)) || !session.WaitConnected(kTimeoutMs)) return 3;
    std::printf("host %lu\n", session.Host().ProcessId());
    std::fflush(stdout);
    if (std::string(pszMode) == "busy") {
        CallExec(session.Server(), L"spin", L"60000");  // never returns: we are killed
    }
    PumpFor(60000);
    return 0;
}

void ExpectRunEndsAfterClientDies(const char* pszMode, const char* pszCommandExpected)
{
    if (!CanReadHostLog()) GTEST_SKIP() << "the host's log cannot be read here";
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    wchar_t szSelf[MAX_PATH];
    ::GetModuleFileNameW(nullptr, szSelf, MAX_PATH);
    HostOptions clientOptions;
    clientOptions.strCommandLine = L"\"" + std::wstring(szSelf) + L"\" --dying-client " +
                                   std::wstring(pszMode, pszMode + strlen(pszMode));
    clientOptions.bCaptureOutput = true;
    CHostProcess client;
    ASSERT_EQ(client.Start(clientOptions), S_OK);
    DWORD dwHostPid = 0;
    ASSERT_TRUE(PumpUntil([&] { return std::sscanf(client.Output().c_str(), "host %lu", &dwHostPid) == 1; }, kTimeoutMs))
        << client.Output();
    ::Sleep(300);  // let a busy client's command start
    CHostProcess host;
    HostOptions attach;
    ASSERT_EQ(host.Attach(dwHostPid, attach), S_OK);
    client.Kill(9);
    ULONGLONG ullKilled = ::GetTickCount64();
    auto exitCode = host.WaitForExit(15000);
    ULONGLONG ullElapsed = ::GetTickCount64() - ullKilled;
    ASSERT_TRUE(exitCode.has_value()) << "the host outlived its client";
    EXPECT_EQ(*exitCode, 0u);
    EXPECT_LT(ullElapsed, 11000u);
    auto vecLines = LogLines(host);
    EXPECT_NE(std::find(vecLines.begin(), vecLines.end(), Line("Client process unavailable, stopping all threads")),
              vecLines.end());
    (void)pszCommandExpected;
    ::CoUninitialize();
}

}  // namespace

TEST(ClientDeath, WhileIdleEndsTheRun) { ExpectRunEndsAfterClientDies("idle", nullptr); }
TEST(ClientDeath, InTheMiddleOfACommandEndsTheRun) { ExpectRunEndsAfterClientDies("busy", "spin"); }

int main(int argc, char** argv)
{
    if (argc >= 3 && std::string(argv[1]) == "--dying-client") {
        return RunDyingClient(argv[2]);
    }
    ::testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
