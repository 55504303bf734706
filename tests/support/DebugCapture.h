#pragma once
// Captures this process's debug output (every OutputDebugStringA line, from
// any thread) through a vectored exception handler for DBG_PRINTEXCEPTION_C,
// so that tests can assert exact log lines and that nothing else was logged.
#include <windows.h>

#include <string>
#include <vector>

class CDebugCapture
{
public:
    CDebugCapture();   // starts capturing; one capture at a time
    ~CDebugCapture();  // stops
    CDebugCapture(const CDebugCapture&) = delete;
    CDebugCapture& operator=(const CDebugCapture&) = delete;

    std::vector<std::string> Lines() const;
    void Clear();
    // Waits until the given number of lines has arrived (or the timeout passed).
    bool WaitForCount(size_t nCount, DWORD dwTimeoutMs) const;

private:
    PVOID m_hHandler;
};

// The exact line LogError writes for a message.
std::string LogLine(const std::string& strMessage);
