#include "host/RunState.h"

#include "common/Raii.h"
#include "diag/LogError.h"

std::atomic<DWORD> g_dwMainThreadId{0};
std::deque<OutputRecord> g_OutputQueue;
CRITICAL_SECTION g_csOutputQueue;

namespace {

// Guards the existence of g_csOutputQueue: other threads hold it shared
// while they use the lock, the main thread exclusively while it makes or
// deletes it. It needs no initialization, so it exists at every moment.
SRWLOCK g_srwQueueLifetime = SRWLOCK_INIT;
std::atomic<bool> g_bQueueOpen{false};

}  // namespace

bool OpenOutputQueue() noexcept
{
    CSrwExclusiveLock lifetime(&g_srwQueueLifetime);
    if (g_bQueueOpen) {
        return true;
    }
    if (!::InitializeCriticalSectionAndSpinCount(&g_csOutputQueue, 0)) {
        return false;
    }
    g_bQueueOpen = true;
    return true;
}

void CloseOutputQueue() noexcept
{
    CSrwExclusiveLock lifetime(&g_srwQueueLifetime);
    if (!g_bQueueOpen) {
        return;
    }
    {
        CCritSecLock lock(&g_csOutputQueue);
        g_OutputQueue.clear();
    }
    ::DeleteCriticalSection(&g_csOutputQueue);
    g_bQueueOpen = false;
}

bool IsOutputQueueOpen() noexcept
{
    return g_bQueueOpen;
}

bool QueueOutput(const wchar_t* pszText, bool bIsError)
{
    CSrwSharedLock lifetime(&g_srwQueueLifetime);
    if (!g_bQueueOpen) {
        return false;
    }
    // Copy before taking the lock: the main thread may hold it for a whole
    // flush, and the copy is the slow part of a print.
    OutputRecord record{std::wstring(pszText), bIsError};
    CCritSecLock lock(&g_csOutputQueue);
    g_OutputQueue.push_back(std::move(record));
    return true;
}

void LogErrorNoThrow(const char* pszMessage) noexcept
{
    try {
        LogError(pszMessage);
    } catch (...) {
        // Out of memory for the line itself: nothing left to report with.
    }
}
