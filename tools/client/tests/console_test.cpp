// Tests of the two programs built on the client library: the console client
// (its line syntax, and whole sessions against the stand-in server, read
// back as transcripts) and the log viewer.
#include <gtest/gtest.h>

#include <algorithm>

#include "Script.h"
#include "TestHelpers.h"

namespace {

// A script file that is deleted again.
class CTempScript
{
public:
    explicit CTempScript(const std::string& strText)
    {
        wchar_t szDir[MAX_PATH], szPath[MAX_PATH];
        ::GetTempPathW(MAX_PATH, szDir);
        ::GetTempFileNameW(szDir, L"rcs", 0, szPath);
        m_strPath = szPath;
        CHandle hFile(::CreateFileW(szPath, GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr));
        DWORD cbWritten = 0;
        ::WriteFile(hFile.Get(), strText.data(), static_cast<DWORD>(strText.size()), &cbWritten, nullptr);
    }
    ~CTempScript() { ::DeleteFileW(m_strPath.c_str()); }
    const std::wstring& Path() const { return m_strPath; }

private:
    std::wstring m_strPath;
};

struct ProgramRun
{
    std::optional<DWORD> dwExitCode;
    std::string strOutput;
};

ProgramRun RunProgram(const std::wstring& strCommandLine, const std::optional<std::string>& strStdin = std::nullopt)
{
    CHostProcess program;
    HostOptions options;
    options.strCommandLine = strCommandLine;
    options.bCaptureOutput = true;
    options.strStdin = strStdin;
    ProgramRun run;
    if (FAILED(program.Start(options))) return run;
    run.dwExitCode = program.WaitForExit(kWaitMs * 2, false);
    if (!run.dwExitCode) program.Kill();
    run.strOutput = program.Output();
    return run;
}

std::wstring FakeServerHost()
{
    return L"--host " + QuoteArg(ChildCommand(L"fakeserver"));
}

ProgramRun RunConsole(const std::wstring& strArgs, const std::optional<std::string>& strStdin = std::nullopt)
{
    return RunProgram(SiblingCommand(L"replconsole.exe", strArgs), strStdin);
}

// ---- the line syntax ---------------------------------------------------------------

TEST(ConsoleLine, TheFirstWordIsTheCommandAndTheRestTheArgument)
{
    ConsoleLine line = ParseConsoleLine(L"print  two  blanks ");
    EXPECT_EQ(line.kind, ConsoleLine::Kind::Exec);
    EXPECT_EQ(line.strCommand, L"print");
    EXPECT_EQ(line.strArgument, L" two  blanks ");
    EXPECT_EQ(line.chInterrupt, 0);
    ConsoleLine bare = ParseConsoleLine(L"noop");
    EXPECT_EQ(bare.strCommand, L"noop");
    EXPECT_EQ(bare.strArgument, L"");
    EXPECT_EQ(bare.EchoText(), L"noop");
    EXPECT_EQ(ParseConsoleLine(L"   ").kind, ConsoleLine::Kind::Blank);
    EXPECT_EQ(ParseConsoleLine(L"# note").kind, ConsoleLine::Kind::Comment);
}

TEST(ConsoleLine, DirectivesCarryTheirValues)
{
    ConsoleLine interrupt = ParseConsoleLine(L"!interrupt-after 250 spin 5000");
    EXPECT_EQ(interrupt.kind, ConsoleLine::Kind::Exec);
    EXPECT_EQ(interrupt.dwMs, 250u);
    EXPECT_EQ(interrupt.chInterrupt, 'a');
    EXPECT_EQ(interrupt.strCommand, L"spin");
    EXPECT_EQ(interrupt.strArgument, L"5000");
    EXPECT_EQ(interrupt.EchoText(), L"spin 5000");
    EXPECT_EQ(ParseConsoleLine(L"!interrupt-all-after 10 spin").chInterrupt, 'k');

    ConsoleLine answer = ParseConsoleLine(L"!answer two words");
    EXPECT_EQ(answer.kind, ConsoleLine::Kind::Answer);
    EXPECT_EQ(answer.strArgument, L"two words");
    ConsoleLine com = ParseConsoleLine(L"!com com-echo 5");
    EXPECT_EQ(com.kind, ConsoleLine::Kind::ExecCom);
    EXPECT_EQ(com.EchoText(), L"!com com-echo 5");
    EXPECT_EQ(ParseConsoleLine(L"!sleep 20").dwMs, 20u);
    EXPECT_EQ(ParseConsoleLine(L"!quit").kind, ConsoleLine::Kind::Quit);
}

TEST(ConsoleLine, MalformedDirectivesAreInvalid)
{
    for (const wchar_t* pszBad : {L"!interrupt-after spin", L"!interrupt-after 10", L"!sleep soon", L"!nope", L"!com"}) {
        EXPECT_EQ(ParseConsoleLine(pszBad).kind, ConsoleLine::Kind::Invalid) << pszBad;
    }
}

// ---- whole console sessions -------------------------------------------------------------

TEST(ConsoleSession, AScriptIsEchoedWithItsOutputResultsAndTheHostLog)
{
    CTempScript script(
        "# demo\n"
        "echo hello world\n"
        "print out\n"
        "eprint err\n"
        "!answer Ada\n"
        "input name? \n"
        "fail it broke\n"
        "!interrupt-after 200 spin 20000\n"
        "!com com-echo 42\n"
        "!bogus\n");
    ProgramRun run = RunConsole(FakeServerHost() + L" --no-color --log --script " + QuoteArg(script.Path()));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_EQ(run.strOutput,
              "# demo\n"
              ">>> echo hello world\nhello world\n"
              ">>> print out\nout\n"
              ">>> eprint err\nerr\n"
              ">>> input name? \nname? Ada\nAda\n"
              ">>> fail it broke\nerror: it broke\n"
              ">>> spin 20000\ninterrupted: KeyboardInterrupt\n"
              ">>> !com com-echo 42\n42\n"
              "replconsole: unknown directive !bogus: !bogus\n"
              "--- host exited with code 0\n"
              "--- host log ---\nfakeserver: attached\nfakeserver: done\n");
}

TEST(ConsoleSession, OutputSentAfterACommandReturnedComesBeforeTheNextPrompt)
{
    CTempScript script("print-after late\nprint-after later\necho next\n");
    ProgramRun run = RunConsole(FakeServerHost() + L" --no-color --script " + QuoteArg(script.Path()));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_EQ(run.strOutput,
              ">>> print-after late\nlate\n>>> print-after later\nlater\n>>> echo next\nnext\n"
              "--- host exited with code 0\n");
}

TEST(ConsoleSession, ErrorTextIsRedOnlyWhenColourIsOn)
{
    CTempScript script("eprint err\nprint out\n");
    ProgramRun colored = RunConsole(FakeServerHost() + L" --color --script " + QuoteArg(script.Path()));
    EXPECT_NE(colored.strOutput.find(">>> eprint err\n\x1b[31merr\x1b[0m\n>>> print out\nout\n"), std::string::npos)
        << colored.strOutput;
    ProgramRun plain = RunConsole(FakeServerHost() + L" --no-color --script " + QuoteArg(script.Path()));
    EXPECT_EQ(plain.strOutput.find('\x1b'), std::string::npos);
}

TEST(ConsoleSession, InteractiveLinesAndInputAnswersComeFromStdin)
{
    ProgramRun run = RunConsole(FakeServerHost() + L" --no-color", std::string("echo hi\r\ninput who? \nBob\nprint x"));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_EQ(run.strOutput,
              ">>> echo hi\nhi\n"
              ">>> input who? \nwho? Bob\nBob\n"
              ">>> print x\nx\n"
              ">>> \n--- host exited with code 0\n");
}

TEST(ConsoleSession, EndOfInputAtAPromptGivesNoInput)
{
    ProgramRun run = RunConsole(FakeServerHost() + L" --no-color", std::string("input who? \n"));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_NE(run.strOutput.find(">>> input who? \nwho? \nerror: EOFError\n>>> \n"), std::string::npos) << run.strOutput;
}

TEST(ConsoleSession, AServerThatEndsTheSessionStopsTheScript)
{
    CTempScript script("quit\necho never\n");
    ProgramRun run = RunConsole(FakeServerHost() + L" --no-color --script " + QuoteArg(script.Path()));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_EQ(run.strOutput, ">>> quit\nquit\n--- host exited with code 0\n");
}

TEST(ConsoleSession, AHostThatNeverConnectsEndsWithCodeTwo)
{
    ProgramRun run = RunConsole(L"--no-color --timeout 5000 --host " + QuoteArg(ChildCommand(L"tick 1 1")));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(2));
    EXPECT_NE(run.strOutput.find("replconsole: the host did not connect\n"), std::string::npos) << run.strOutput;
    EXPECT_NE(run.strOutput.find("--- host exited with code 7\n"), std::string::npos) << run.strOutput;

    ProgramRun missing = RunConsole(L"--no-color --host no_such_host.exe");
    EXPECT_EQ(missing.dwExitCode, std::optional<DWORD>(2));
    EXPECT_NE(missing.strOutput.find("cannot start the host"), std::string::npos);
}

TEST(ConsoleSession, BadOptionsEndWithCodeOne)
{
    EXPECT_EQ(RunConsole(L"--frobnicate").dwExitCode, std::optional<DWORD>(1));
    EXPECT_EQ(RunConsole(L"--script").dwExitCode, std::optional<DWORD>(1));
    EXPECT_EQ(RunConsole(L"--script Z:\\no\\such\\script.txt").dwExitCode, std::optional<DWORD>(1));
}

// ---- the log viewer --------------------------------------------------------------------

TEST(LogView, PrintsEveryDebugLineAndExitsWithTheProgramsCode)
{
    ProgramRun run = RunProgram(SiblingCommand(L"repl_logview.exe", L"--prefix \"[log] \" " + ChildCommand(L"debug 2 3 4")));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(4));
    for (const char* pszLine : {"[log] t0 0\n", "[log] t0 2\n", "[log] t1 1\n", "[log] wide line\n"}) {
        EXPECT_NE(run.strOutput.find(pszLine), std::string::npos) << pszLine << run.strOutput;
    }
    EXPECT_LT(run.strOutput.find("t0 0"), run.strOutput.find("t0 1"));
    EXPECT_EQ(std::count(run.strOutput.begin(), run.strOutput.end(), '\n'), 7);
}

TEST(LogView, TheProgramKeepsItsOwnOutputAndBadArgumentsFail)
{
    ProgramRun run = RunProgram(SiblingCommand(L"repl_logview.exe", ChildCommand(L"output")));
    EXPECT_EQ(run.dwExitCode, std::optional<DWORD>(0));
    EXPECT_NE(run.strOutput.find("out-text"), std::string::npos);
    EXPECT_EQ(RunProgram(SiblingCommand(L"repl_logview.exe", L"")).dwExitCode, std::optional<DWORD>(255));
    EXPECT_EQ(RunProgram(SiblingCommand(L"repl_logview.exe", L"no_such_program.exe")).dwExitCode,
              std::optional<DWORD>(255));
}

}  // namespace
