#pragma once
// The execution depth and the two interrupt flags, shared between the main
// thread (which runs commands) and the threads that interrupt them.
//
// Invariant: whenever g_nExecDepth is 0, both flags are false. A single
// small lock orders the depth changes of the main thread against the depth
// test and flag setting of an interrupt; without it an interrupt that read
// depth 1 could set g_bInterrupted after the outermost command ended, and
// every later command would be refused.
//
// Lock order: the interpreter lock may be held when this lock is taken,
// never the other way round (nothing blocking runs under this lock).
#include <atomic>

#include "python/PythonFunctions.h"

extern std::atomic<int> g_nExecDepth;
extern std::atomic<bool> g_bInterrupted;
extern std::atomic<bool> g_bInterruptPending;

// Main thread, when a command starts: depth + 1; a new outermost command
// starts with both flags clear.
void EnterExecDepth() noexcept;

struct ExecLeaveResult
{
    bool bInterrupted;     // an interrupt arrived while the command ran
    bool bRaiseDeferred;   // depth fell back to 1 with an interrupt pending
};

// Main thread, when a command ends: depth - 1; back at 0 both flags clear;
// back at 1 a pending interrupt is handed to the caller (once) to raise.
ExecLeaveResult LeaveExecDepth() noexcept;

struct InterruptMark
{
    int nDepth;       // the depth seen under the lock
    bool bRaised;     // pfnSetInterrupt was called (depth 1 and non-null)
};

// Interrupt side, called with the interpreter lock held: at depth > 0 sets
// g_bInterrupted; at depth 1 calls pfnSetInterrupt (when not null) while
// the depth cannot change; above 1 sets g_bInterruptPending instead.
InterruptMark MarkInterrupt(PFN_PyErr_SetInterrupt pfnSetInterrupt) noexcept;
