#pragma once
// The system's one failure report: one line "ERROR [DeDazaRuvida]: <message>\n"
// handed whole to the debugger output. Callable from any thread at any time.
// Raises CAtlException(E_OUTOFMEMORY) when the line cannot be allocated.
void LogError(const char* pszMessage);
