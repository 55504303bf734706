#include "server/ExecState.h"

#include <windows.h>

#include "common/Raii.h"

std::atomic<int> g_nExecDepth{0};
std::atomic<bool> g_bInterrupted{false};
std::atomic<bool> g_bInterruptPending{false};

namespace {
SRWLOCK g_srwExecState = SRWLOCK_INIT;
}

void EnterExecDepth() noexcept
{
    CSrwExclusiveLock lock(&g_srwExecState);
    if (++g_nExecDepth == 1) {
        g_bInterrupted = false;
        g_bInterruptPending = false;
    }
}

ExecLeaveResult LeaveExecDepth() noexcept
{
    CSrwExclusiveLock lock(&g_srwExecState);
    ExecLeaveResult result{g_bInterrupted.load(), false};
    int nDepth = --g_nExecDepth;
    if (nDepth == 0) {
        g_bInterrupted = false;
        g_bInterruptPending = false;
    } else if (nDepth == 1 && g_bInterruptPending) {
        g_bInterruptPending = false;
        result.bRaiseDeferred = true;
    }
    return result;
}

InterruptMark MarkInterrupt(PFN_PyErr_SetInterrupt pfnSetInterrupt) noexcept
{
    CSrwExclusiveLock lock(&g_srwExecState);
    InterruptMark mark{g_nExecDepth.load(), false};
    if (mark.nDepth <= 0) {
        return mark;
    }
    g_bInterrupted = true;
    if (mark.nDepth == 1) {
        if (pfnSetInterrupt != nullptr) {
            pfnSetInterrupt();
            mark.bRaised = true;
        }
    } else {
        g_bInterruptPending = true;
    }
    return mark;
}
