#include "diag/LogError.h"

#include <windows.h>

#include <cstdio>
#include <new>
#include <stdexcept>
#include <string>

#include "common/AtlException.h"

namespace {

constexpr char kLogFormat[] = "ERROR [DeDazaRuvida]: %s\n";

// Formats the line into a string sized from the formatted length, so that a
// message of any size comes out whole.
std::string FormatLogLine(const char* pszMessage)
{
    int cch = std::snprintf(nullptr, 0, kLogFormat, pszMessage);
    if (cch < 0) {
        ThrowHResult(E_FAIL);
    }
    std::string strLine;
    try {
        strLine.resize(static_cast<size_t>(cch));
    } catch (const std::bad_alloc&) {
        ThrowHResult(E_OUTOFMEMORY);
    } catch (const std::length_error&) {
        ThrowHResult(E_OUTOFMEMORY);
    }
    // The string keeps room for the terminating NUL past size().
    if (std::snprintf(&strLine[0], strLine.size() + 1, kLogFormat, pszMessage) < 0) {
        ThrowHResult(E_FAIL);
    }
    return strLine;
}

}  // namespace

void LogError(const char* pszMessage)
{
    if (pszMessage == nullptr) {
        return;
    }
    std::string strLine = FormatLogLine(pszMessage);
    ::OutputDebugStringA(strLine.c_str());
}
