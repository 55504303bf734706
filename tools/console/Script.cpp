#include "Script.h"

#include <cwchar>

namespace {

// Splits at the first blank: the word before, the rest after it.
std::wstring FirstWord(const std::wstring& strText, std::wstring& strRest)
{
    size_t nBlank = strText.find(L' ');
    strRest = nBlank == std::wstring::npos ? std::wstring() : strText.substr(nBlank + 1);
    return strText.substr(0, nBlank);
}

bool ParseMs(const std::wstring& strText, DWORD& dwMs)
{
    if (strText.empty() || strText.find_first_not_of(L"0123456789") != std::wstring::npos) return false;
    dwMs = static_cast<DWORD>(std::wcstoul(strText.c_str(), nullptr, 10));
    return true;
}

ConsoleLine Invalid(const std::wstring& strError)
{
    ConsoleLine line;
    line.kind = ConsoleLine::Kind::Invalid;
    line.strError = strError;
    return line;
}

ConsoleLine ExecLine(ConsoleLine::Kind kind, const std::wstring& strText)
{
    ConsoleLine line;
    line.kind = kind;
    line.strCommand = FirstWord(strText, line.strArgument);
    if (line.strCommand.empty()) return Invalid(L"a command is missing");
    return line;
}

ConsoleLine InterruptAfter(const std::wstring& strRest, char chInterrupt)
{
    std::wstring strCommandText;
    DWORD dwMs = 0;
    if (!ParseMs(FirstWord(strRest, strCommandText), dwMs)) return Invalid(L"milliseconds expected");
    ConsoleLine line = ExecLine(ConsoleLine::Kind::Exec, strCommandText);
    line.dwMs = dwMs;
    line.chInterrupt = line.kind == ConsoleLine::Kind::Exec ? chInterrupt : 0;
    return line;
}

ConsoleLine Directive(const std::wstring& strText)
{
    std::wstring strRest;
    const std::wstring strName = FirstWord(strText, strRest);
    ConsoleLine line;
    if (strName == L"!com") return ExecLine(ConsoleLine::Kind::ExecCom, strRest);
    if (strName == L"!interrupt-after") return InterruptAfter(strRest, 'a');
    if (strName == L"!interrupt-all-after") return InterruptAfter(strRest, 'k');
    if (strName == L"!answer") {
        line.kind = ConsoleLine::Kind::Answer;
        line.strArgument = strRest;
    } else if (strName == L"!sleep") {
        line.kind = ConsoleLine::Kind::Sleep;
        if (!ParseMs(strRest, line.dwMs)) return Invalid(L"milliseconds expected");
    } else if (strName == L"!quit") {
        line.kind = ConsoleLine::Kind::Quit;
    } else {
        return Invalid(L"unknown directive " + strName);
    }
    return line;
}

}  // namespace

std::wstring ConsoleLine::EchoText() const
{
    std::wstring strEcho = kind == Kind::ExecCom ? L"!com " + strCommand : strCommand;
    return strArgument.empty() ? strEcho : strEcho + L" " + strArgument;
}

ConsoleLine ParseConsoleLine(const std::wstring& strLine)
{
    ConsoleLine line;
    if (strLine.find_first_not_of(L" \t") == std::wstring::npos) return line;
    if (strLine[0] == L'#') {
        line.kind = ConsoleLine::Kind::Comment;
        line.strArgument = strLine;
        return line;
    }
    if (strLine[0] == L'!') return Directive(strLine);
    return ExecLine(ConsoleLine::Kind::Exec, strLine);
}
