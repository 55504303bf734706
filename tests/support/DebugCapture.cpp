#include "support/DebugCapture.h"

#include <mutex>

namespace {

constexpr DWORD kDbgPrintException = 0x40010006;  // DBG_PRINTEXCEPTION_C

std::mutex g_mutexLines;
std::vector<std::string> g_vecLines;

LONG CALLBACK CaptureHandler(EXCEPTION_POINTERS* pInfo)
{
    const EXCEPTION_RECORD* pRecord = pInfo->ExceptionRecord;
    if (pRecord->ExceptionCode != kDbgPrintException || pRecord->NumberParameters < 2) {
        return EXCEPTION_CONTINUE_SEARCH;
    }
    // Parameter 0: length including the NUL; parameter 1: the text.
    size_t cch = static_cast<size_t>(pRecord->ExceptionInformation[0]);
    const char* psz = reinterpret_cast<const char*>(pRecord->ExceptionInformation[1]);
    std::string strLine(psz, cch > 0 ? cch - 1 : 0);
    {
        std::lock_guard<std::mutex> lock(g_mutexLines);
        g_vecLines.push_back(std::move(strLine));
    }
    return EXCEPTION_CONTINUE_EXECUTION;
}

}  // namespace

CDebugCapture::CDebugCapture()
{
    Clear();
    m_hHandler = ::AddVectoredExceptionHandler(1, CaptureHandler);
}

CDebugCapture::~CDebugCapture()
{
    ::RemoveVectoredExceptionHandler(m_hHandler);
}

std::vector<std::string> CDebugCapture::Lines() const
{
    std::lock_guard<std::mutex> lock(g_mutexLines);
    return g_vecLines;
}

void CDebugCapture::Clear()
{
    std::lock_guard<std::mutex> lock(g_mutexLines);
    g_vecLines.clear();
}

bool CDebugCapture::WaitForCount(size_t nCount, DWORD dwTimeoutMs) const
{
    ULONGLONG ullDeadline = ::GetTickCount64() + dwTimeoutMs;
    for (;;) {
        {
            std::lock_guard<std::mutex> lock(g_mutexLines);
            if (g_vecLines.size() >= nCount) return true;
        }
        if (::GetTickCount64() >= ullDeadline) return false;
        ::Sleep(5);
    }
}

std::string LogLine(const std::string& strMessage)
{
    return "ERROR [DeDazaRuvida]: " + strMessage + "\n";
}
