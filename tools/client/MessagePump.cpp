#include "client/MessagePump.h"

namespace {

// Dispatches what is queued; reports a WM_QUIT it took out of the queue.
bool DispatchQueued(bool* pbQuit, WPARAM* pwQuitCode)
{
    bool bAny = false;
    MSG msg;
    while (::PeekMessageW(&msg, nullptr, 0, 0, PM_REMOVE)) {
        bAny = true;
        if (msg.message == WM_QUIT) {
            *pbQuit = true;
            *pwQuitCode = msg.wParam;
            continue;
        }
        ::TranslateMessage(&msg);
        ::DispatchMessageW(&msg);
    }
    return bAny;
}

DWORD Remaining(ULONGLONG ullDeadline, DWORD dwTimeoutMs)
{
    if (dwTimeoutMs == INFINITE) return INFINITE;
    ULONGLONG ullNow = ::GetTickCount64();
    return ullNow >= ullDeadline ? 0 : static_cast<DWORD>(ullDeadline - ullNow);
}

// Puts back a WM_QUIT that a wait took out of the queue.
class CQuitKeeper
{
public:
    ~CQuitKeeper()
    {
        if (m_bQuit) ::PostQuitMessage(static_cast<int>(m_wCode));
    }
    bool m_bQuit = false;
    WPARAM m_wCode = 0;
};

}  // namespace

void PumpPending()
{
    CQuitKeeper quit;
    DispatchQueued(&quit.m_bQuit, &quit.m_wCode);
}

DWORD PumpWaitAny(const HANDLE* phHandles, DWORD nHandles, DWORD dwTimeoutMs)
{
    if (nHandles >= MAXIMUM_WAIT_OBJECTS) return WAIT_FAILED;
    CQuitKeeper quit;
    const ULONGLONG ullDeadline = ::GetTickCount64() + (dwTimeoutMs == INFINITE ? 0 : dwTimeoutMs);
    for (;;) {
        // Messages first: a call that is already queued must not wait for
        // the handle, and a signaled handle is still seen below.
        DispatchQueued(&quit.m_bQuit, &quit.m_wCode);
        DWORD dwWait = ::MsgWaitForMultipleObjectsEx(nHandles, phHandles, Remaining(ullDeadline, dwTimeoutMs),
                                                     QS_ALLINPUT, MWMO_INPUTAVAILABLE);
        if (dwWait < WAIT_OBJECT_0 + nHandles) return dwWait;
        if (dwWait == WAIT_TIMEOUT || dwWait == WAIT_FAILED) return dwWait;
        if (dwWait >= WAIT_ABANDONED_0 && dwWait < WAIT_ABANDONED_0 + nHandles) return dwWait;
        if (Remaining(ullDeadline, dwTimeoutMs) == 0) {
            DispatchQueued(&quit.m_bQuit, &quit.m_wCode);
            DWORD dwLast = ::WaitForMultipleObjects(nHandles, phHandles, FALSE, 0);
            return nHandles > 0 && dwLast < WAIT_OBJECT_0 + nHandles ? dwLast : WAIT_TIMEOUT;
        }
    }
}

bool PumpWait(HANDLE h, DWORD dwTimeoutMs)
{
    return PumpWaitAny(&h, 1, dwTimeoutMs) == WAIT_OBJECT_0;
}

void PumpFor(DWORD dwMs)
{
    PumpWaitAny(nullptr, 0, dwMs);
}

bool PumpUntil(const std::function<bool()>& fnDone, DWORD dwTimeoutMs, DWORD dwPollMs)
{
    const ULONGLONG ullDeadline = ::GetTickCount64() + (dwTimeoutMs == INFINITE ? 0 : dwTimeoutMs);
    while (!fnDone()) {
        DWORD dwLeft = Remaining(ullDeadline, dwTimeoutMs);
        if (dwLeft == 0) return fnDone();
        PumpWaitAny(nullptr, 0, dwLeft < dwPollMs ? dwLeft : dwPollMs);
    }
    return true;
}
