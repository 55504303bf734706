// A long session across processes: many thousands of commands that mix
// results, output, input, failures and ExecCom conversions, each one checked,
// and afterwards the host's handles, private memory, live task-allocator
// blocks (every BSTR is one) and the runtime double's live objects back at
// the values they had after the warm-up.
//
// Usage: soak_test [gtest options] [--commands <n>]  (default kDefaultCommands)
#include <gtest/gtest.h>

#include <windows.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "client/ReplClient.h"

namespace {

// Sized for well under a minute on a two-core machine under Wine, where a
// command of this mix costs about 1.5 ms (one cross-process call, plus a
// call back for each print and input); pass --commands 100000 for the long
// run (about two and a half minutes).
constexpr int kDefaultCommands = 30000;
constexpr int kWarmupCommands = 2000;
constexpr int kMixLength = 10;
constexpr DWORD kTimeoutMs = 20000;
const std::string kLogPrefix = "ERROR [DeDazaRuvida]: ";

int g_nCommands = kDefaultCommands;

// What the host reports about itself.
struct Resources
{
    long nHandles = -1;
    unsigned long long cbPrivate = 0;
    long nBlocks = -1;
    long nLive = -1;
    long nViolations = -1;
    long nThreads = -1;
};

bool ReadResources(IDispatch* pServer, Resources& resources)
{
    CallResult result = CallExec(pServer, L"resources", L"");
    return result.hr == S_OK &&
           std::swscanf(result.Text().c_str(),
                        L"handles=%ld private=%llu blocks=%ld live=%ld violations=%ld threads=%ld", &resources.nHandles,
                        &resources.cbPrivate, &resources.nBlocks, &resources.nLive, &resources.nViolations,
                        &resources.nThreads) == 6;
}

std::string Describe(const Resources& resources)
{
    char sz[160];
    std::snprintf(sz, sizeof sz, "handles=%ld private=%llu blocks=%ld live=%ld threads=%ld", resources.nHandles,
                  resources.cbPrivate, resources.nBlocks, resources.nLive, resources.nThreads);
    return sz;
}

VARIANT Int(int n)
{
    VARIANT var;
    ::VariantInit(&var);
    var.vt = VT_I4;
    var.lVal = n;
    return var;
}

class Soak : public ::testing::Test
{
protected:
    void SetUp() override
    {
        ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
        SessionOptions options;
        options.strHostCommand = QuoteArg(ProgramDirectory() + L"\\repl_testhost.exe");
        options.strExtraArgs = L"--track-allocations";
        options.host.bDebug = true;
        options.host.bCaptureOutput = true;
        ASSERT_EQ(m_session.Start(options), S_OK);
        ASSERT_TRUE(m_session.WaitConnected(kTimeoutMs)) << "the server never connected";
        m_spServer = m_session.Server();
        // Input is answered from the prompt, so that each answer is checkable.
        m_session.Client().SetInputHandler(
            [](const std::wstring& strPrompt) { return CInputAnswer::Text(strPrompt + L"!"); });
        m_session.Client().SetPrintHandler([this](const std::wstring& strText, bool bIsError) {
            ++m_nPrints;
            m_strLastPrint = strText;
            m_bLastPrintError = bIsError;
        });
    }
    void TearDown() override
    {
        m_spServer.Release();
        ::CoUninitialize();
    }

    // Runs command number n of the mix and checks its outcome; false (with
    // a failure recorded) when the outcome is wrong.
    bool RunOne(int n)
    {
        const std::wstring strN = std::to_wstring(n);
        switch (n % kMixLength) {
        case 0:
        case 1:
        case 2:
            return ExpectText(CallExec(m_spServer, L"echo", L"value " + strN), L"value " + strN, n);
        case 3:
        case 4:
            return ExpectPrinted(L"print", L"line " + strN + L"\n", false, n);
        case 5:
            return ExpectPrinted(L"eprint", L"error " + strN + L"\n", true, n);
        case 6:
            return ExpectText(CallExec(m_spServer, L"input", L"prompt " + strN), L"prompt " + strN + L"!", n);
        case 7: {
            CallResult failure = CallExec(m_spServer, L"fail", L"failure " + strN);
            EXPECT_EQ(failure.Effective(), DISP_E_EXCEPTION) << "command " << n;
            EXPECT_EQ(failure.strDescription, L"failure " + strN) << "command " << n;
            return failure.Effective() == DISP_E_EXCEPTION && failure.strDescription == L"failure " + strN;
        }
        case 8: {
            CallResult echo = CallExecCom(m_spServer, L"com-echo", Int(n));
            bool bOk = echo.hr == S_OK && echo.varResult.vt == VT_I4 && echo.varResult.lVal == n;
            EXPECT_TRUE(bOk) << "command " << n << ": " << DescribeHResult(echo.hr).c_str();
            return bOk;
        }
        default: {
            CallResult failure = CallExecCom(m_spServer, L"com-fail", Int(n));
            EXPECT_EQ(failure.strDescription, L"com failure") << "command " << n;
            return failure.hr == DISP_E_EXCEPTION && failure.strDescription == L"com failure";
        }
        }
    }

    bool ExpectText(const CallResult& result, const std::wstring& strExpected, int n)
    {
        EXPECT_EQ(result.hr, S_OK) << "command " << n;
        EXPECT_EQ(result.Text(), strExpected) << "command " << n;
        return result.hr == S_OK && result.Text() == strExpected;
    }

    // Main-thread output reaches the client before Exec returns.
    bool ExpectPrinted(const wchar_t* pszCommand, const std::wstring& strText, bool bIsError, int n)
    {
        size_t nBefore = m_nPrints;
        CallResult result = CallExec(m_spServer, pszCommand, strText);
        bool bOk = result.hr == S_OK && m_nPrints == nBefore + 1 && m_strLastPrint == strText &&
                   m_bLastPrintError == bIsError;
        EXPECT_TRUE(bOk) << "command " << n << ": " << DescribeHResult(result.hr).c_str() << ", "
                         << m_nPrints - nBefore << " prints";
        return bOk;
    }

    // Every thousand commands: the client forgets its record of the calls,
    // and the host lets the runtime double free the dead objects it keeps,
    // so that neither side's test bookkeeping grows with the session.
    void Checkpoint()
    {
        m_session.Client().ClearCalls();
        Resources resources;
        EXPECT_TRUE(ReadResources(m_spServer, resources));
        m_vecSeries.push_back(resources);
    }

    // Runs commands [nFirst, nEnd); stops at the first wrong outcome.
    bool RunRange(int nFirst, int nEnd)
    {
        for (int n = nFirst; n < nEnd; ++n) {
            if (!RunOne(n)) return false;
            if (n % 1000 == 999) Checkpoint();
        }
        return true;
    }

    CReplSession m_session;
    CComPtr<IDispatch> m_spServer;
    std::vector<Resources> m_vecSeries;
    size_t m_nPrints = 0;
    std::wstring m_strLastPrint;
    bool m_bLastPrintError = false;
};

}  // namespace

TEST_F(Soak, ManyMixedCommandsLeaveNothingBehind)
{
    ASSERT_TRUE(RunRange(0, kWarmupCommands));
    Resources before, after;
    ASSERT_TRUE(ReadResources(m_spServer, before));
    ASSERT_GE(before.nBlocks, 0) << "the host does not count allocations";

    ASSERT_TRUE(RunRange(kWarmupCommands, kWarmupCommands + g_nCommands));
    ASSERT_TRUE(ReadResources(m_spServer, after));
    std::printf("%d commands; before: %s; after: %s\n", g_nCommands, Describe(before).c_str(),
                Describe(after).c_str());
    for (size_t i = 0; i < m_vecSeries.size(); i += 10) {
        std::printf("  after %zu000 commands: %s\n", i + 1, Describe(m_vecSeries[i]).c_str());
    }

    EXPECT_EQ(after.nLive, before.nLive) << "Python objects leaked";
    EXPECT_EQ(after.nViolations, 0) << "the interpreter lock or a reference count was misused";
    EXPECT_EQ(after.nBlocks, before.nBlocks) << "task-allocator blocks (strings) leaked";
    // The COM runtime may start a thread of its own during a long session;
    // such a thread commits its stack (about 3 MB under Wine) and may hold a
    // few handles. The server's own threads are the same two all along.
    constexpr long kRuntimeThreads = 2, kHandlesPerThread = 4;
    constexpr unsigned long long kThreadBytes = 4 * 1024 * 1024;
    EXPECT_LE(after.nThreads, before.nThreads + kRuntimeThreads) << "threads leaked";
    long nNewThreads = after.nThreads > before.nThreads ? after.nThreads - before.nThreads : 0;
    EXPECT_LE(after.nHandles, before.nHandles + nNewThreads * kHandlesPerThread) << "handles leaked";
    // Room for the heap to grow by a step or two; a leak of 8 bytes per
    // command would pass this bound at the default size.
    constexpr unsigned long long kHeapSlack = 128 * 1024;
    EXPECT_LE(after.cbPrivate, before.cbPrivate + kHeapSlack + nNewThreads * kThreadBytes)
        << "private memory grew (threads " << before.nThreads << " -> " << after.nThreads << ")";

    CallResult quit;
    auto exitCode = m_session.Finish(kTimeoutMs, &quit);
    ASSERT_TRUE(exitCode.has_value()) << "the host did not exit";
    EXPECT_EQ(*exitCode, 0u);
    EXPECT_EQ(quit.hr, S_OK);
    for (const auto& strLine : m_session.Host().Lines()) {
        EXPECT_NE(strLine.rfind(kLogPrefix, 0), 0u) << "unexpected log line: " << strLine;
    }
}

int main(int argc, char** argv)
{
    ::testing::InitGoogleTest(&argc, argv);
    for (int i = 1; i + 1 < argc; ++i) {
        if (std::string(argv[i]) == "--commands") g_nCommands = std::atoi(argv[i + 1]);
    }
    return RUN_ALL_TESTS();
}
