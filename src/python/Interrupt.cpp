#include "python/Interrupt.h"

#include <tlhelp32.h>

#include "host/RunState.h"
#include "python/PythonFunctions.h"
#include "python/WorkerThreads.h"
#include "server/ExecState.h"

namespace {

constexpr DWORD kReadBufferSize = 256;
constexpr char kInterruptMain = 'a';
constexpr char kInterruptAll = 'k';
// The size of the thread entry record as the snapshot API first defined
// it; every later field is unused here.
constexpr DWORD kThreadEntrySize = 28;

// Entry point of PyThreadState_SetAsyncExc and the exception it raises.
struct AsyncExcTarget
{
    PFN_PyThreadState_SetAsyncExc pfnSetAsyncExc;
    PyObject* pExc;
};

// Raises the exception in every thread of this process except the calling
// thread and the main thread (which only ever gets PyErr_SetInterrupt).
// Called with the interpreter lock held.
void RaiseInOtherThreads(const AsyncExcTarget& target) noexcept
{
    DWORD dwProcessId = ::GetCurrentProcessId();
    DWORD dwSelfId = ::GetCurrentThreadId();
    CHandle hSnapshot(::CreateToolhelp32Snapshot(TH32CS_SNAPTHREAD, 0));
    if (!hSnapshot) {
        LogErrorNoThrow("Cannot enumerate threads");
        return;
    }
    THREADENTRY32 entry{};
    entry.dwSize = kThreadEntrySize;
    if (!::Thread32First(hSnapshot.Get(), &entry)) {
        LogErrorNoThrow("Cannot access thread infos");
        return;
    }
    do {
        DWORD dwThreadId = entry.th32ThreadID;
        if (entry.th32OwnerProcessID != dwProcessId || dwThreadId == dwSelfId ||
            dwThreadId == g_dwMainThreadId.load()) {
            continue;
        }
        // More than one thread state changed means the id matched states
        // it was not meant for: take the exception back.
        if (target.pfnSetAsyncExc(dwThreadId, target.pExc) > 1) {
            target.pfnSetAsyncExc(dwThreadId, nullptr);
        }
    } while (::Thread32Next(hSnapshot.Get(), &entry));
}

bool FindAsyncExcTarget(HMODULE hPythonDLL, AsyncExcTarget& target) noexcept
{
    target.pfnSetAsyncExc = GetPythonProc<PFN_PyThreadState_SetAsyncExc>(hPythonDLL, "PyThreadState_SetAsyncExc");
    // A data export: the address of the variable that holds the type.
    auto ppExc = reinterpret_cast<PyObject* const*>(::GetProcAddress(hPythonDLL, "PyExc_KeyboardInterrupt"));
    target.pExc = ppExc != nullptr ? *ppExc : nullptr;
    return target.pfnSetAsyncExc != nullptr && target.pExc != nullptr;
}

// The part of InterruptPython that runs under the interpreter lock.
void InterruptLocked(HMODULE hPythonDLL, bool bAllThreads) noexcept
{
    // The depth is read again under the shared execution-state lock, which
    // orders this against the start and end of commands.
    auto pfnSetInterrupt = GetPythonProc<PFN_PyErr_SetInterrupt>(hPythonDLL, "PyErr_SetInterrupt");
    InterruptMark mark = MarkInterrupt(pfnSetInterrupt);
    if (mark.nDepth == 1 && !mark.bRaised) {
        LogErrorNoThrow("No Python functions found to interrupt main thread");
    }
    if (!bAllThreads) {
        return;
    }
    AsyncExcTarget target{};
    if (!FindAsyncExcTarget(hPythonDLL, target)) {
        LogErrorNoThrow("No Python functions found to interrupt all threads");
        return;
    }
    RaiseInOtherThreads(target);
}

void DispatchCommand(HMODULE hPythonDLL, char chCommand) noexcept
{
    if (chCommand == kInterruptMain) {
        InterruptPython(hPythonDLL, false);
    } else if (chCommand == kInterruptAll) {
        InterruptPython(hPythonDLL, true);
    } else {
        LogErrorNoThrow("Interrupt: unknown command");
    }
}

unsigned ReadCommands(const ThreadStartArgs& args) noexcept
{
    char rgchBuffer[kReadBufferSize];
    for (;;) {
        if (args.pStop->IsRequested()) {
            return kThreadStopped;
        }
        DWORD cbRead = 0;
        BOOL bRead = ::ReadFile(args.hHandle, rgchBuffer, kReadBufferSize, &cbRead, nullptr);
        if (args.pStop->IsRequested()) {
            return kThreadStopped;  // the read was cancelled to stop the thread
        }
        if (!bRead) {
            return kThreadFailed;  // the write end is closed, or the pipe broke
        }
        if (cbRead == kReadBufferSize) {
            // Commands are single bytes: a full buffer is not the client.
            LogErrorNoThrow("Error reading from interrupt pipe");
            return kThreadFailed;
        }
        if (cbRead > 0) {
            // One read is one command; bytes that came with it are dropped.
            DispatchCommand(args.hPythonDLL, rgchBuffer[0]);
        }
    }
}

}  // namespace

void InterruptPython(HMODULE hPythonDLL, bool bAllThreads) noexcept
{
    if (hPythonDLL == nullptr) {
        LogErrorNoThrow("No Python module given");
        return;
    }
    if (!bAllThreads && g_nExecDepth.load() <= 0) {
        return;  // no command runs: nothing to interrupt, nothing to lock
    }
    auto pfnEnsure = GetPythonProc<PFN_PyGILState_Ensure>(hPythonDLL, "PyGILState_Ensure");
    auto pfnRelease = GetPythonProc<PFN_PyGILState_Release>(hPythonDLL, "PyGILState_Release");
    if (pfnEnsure == nullptr || pfnRelease == nullptr) {
        LogErrorNoThrow("No Python functions found to lock the GIL state");
        return;
    }
    CGilLock gil(pfnEnsure, pfnRelease);
    InterruptLocked(hPythonDLL, bAllThreads);
}

unsigned __stdcall InterruptThreadProc(void* pArgs)
{
    ThreadStartArgs args = TakeStartArgs(pArgs);
    return ReadCommands(args);
}
