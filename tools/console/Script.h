#pragma once
// One line of console input, interactive or from a script:
//
//   <Command> [<Argument>]            Exec(Command, Argument): the first word
//                                     is the command, the rest (after one
//                                     blank) the argument, verbatim
//   !com <Command> [<Argument>]       ExecCom; an integer argument goes as
//                                     VT_I4, anything else as VT_BSTR
//   !answer <text>                    answers the next input prompt
//   !interrupt-after <ms> <Command> [<Argument>]
//                                     Exec, with "a" sent after ms
//   !interrupt-all-after <ms> <Command> [<Argument>]
//                                     the same with "k"
//   !sleep <ms>                       waits, showing output that arrives
//   !quit                             ends the session, as end of input does
//   # text                            a comment, shown in a script's transcript
//   (blank)                           nothing
#include <windows.h>

#include <string>

struct ConsoleLine
{
    enum class Kind
    {
        Blank,
        Comment,
        Exec,
        ExecCom,
        Answer,
        Sleep,
        Quit,
        Invalid,
    };

    Kind kind = Kind::Blank;
    std::wstring strCommand;   // Exec, ExecCom
    std::wstring strArgument;  // Exec, ExecCom; Answer: the answer
    DWORD dwMs = 0;            // Sleep; Exec: delay of the interrupt
    char chInterrupt = 0;      // Exec: 'a' or 'k' to send after dwMs, 0 for none
    std::wstring strError;     // Invalid: what is wrong
    // What a user would have typed for the command (for echoing).
    std::wstring EchoText() const;
};

ConsoleLine ParseConsoleLine(const std::wstring& strLine);
