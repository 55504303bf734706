// The functions through which Python code prints, asks for input, sets a
// command's result and quits; and the flush that carries output queued by
// other threads to the client on the main thread.
#include <windows.h>
#include <oleauto.h>

#include <new>
#include <stdexcept>

#include "diag/LogError.h"
#include "host/Bridge.h"
#include "host/KxRepl.h"
#include "host/RunState.h"
#include "server/ReplServerImpl.h"

namespace {

// Hands a print of another thread to the main thread: queued, then a
// wake-up so that an idle main loop flushes it.
void QueueForMainThread(const wchar_t* pszText, bool bIsError) noexcept
{
    try {
        if (!QueueOutput(pszText, bIsError)) {
            return;  // no run's queue exists now: the text is dropped
        }
    } catch (const std::bad_alloc&) {
        LogErrorNoThrow("Cannot copy output text, dropped");
        return;
    } catch (const std::length_error&) {
        LogErrorNoThrow("Cannot copy output text, dropped");
        return;
    }
    ::PostThreadMessageW(g_dwMainThreadId.load(), WM_PAINT, 0, 0);
}

}  // namespace

void FlushQueuedOutput() noexcept
{
    if (!IsOutputQueueOpen()) {
        return;
    }
    // Re-entrant: the lock stays held while the client is called, and a
    // command the client runs meanwhile may print and flush again on this
    // thread. Each record leaves the queue before it is sent, so a nested
    // flush goes on from the current front: nothing is sent twice, nothing
    // is skipped, and the order holds. No other thread can append while
    // the lock is held, so the walk ends when the queue is empty.
    CCritSecLock lock(&g_csOutputQueue);
    while (!g_OutputQueue.empty()) {
        CComObject<KxCIReplServerImpl>* pServer = g_pCurrentServer;
        if (pServer == nullptr) {
            g_OutputQueue.clear();  // the run is over: nobody to send to
            break;
        }
        OutputRecord record = std::move(g_OutputQueue.front());
        g_OutputQueue.pop_front();
        pServer->PrintToClient(record.Text.c_str(), record.bIsError);
    }
}

extern "C" {

void __cdecl KxReplPrint(const wchar_t* pszText, BOOL bIsError)
{
    if (pszText == nullptr || pszText[0] == L'\0') {
        return;
    }
    bool bError = bIsError != FALSE;
    if (!IsMainThread()) {
        QueueForMainThread(pszText, bError);
        return;
    }
    FlushQueuedOutput();  // what other threads queued goes out first
    if (g_pCurrentServer != nullptr) {
        g_pCurrentServer->PrintToClient(pszText, bError);
    }
}

BSTR __cdecl KxReplGetUserInput(const wchar_t* pszPrompt)
{
    BSTR bstrAnswer = nullptr;
    if (!IsMainThread()) {
        LogErrorNoThrow("Can get user input from main thread only");
        return nullptr;
    }
    if (g_pCurrentServer != nullptr) {
        g_pCurrentServer->GetInputFromClient(pszPrompt, &bstrAnswer);
    }
    return bstrAnswer;
}

void __cdecl KxReplQuit(void)
{
    if (!IsMainThread()) {
        LogErrorNoThrow("Call Quit from main thread only");
        return;
    }
    if (g_pCurrentServer != nullptr && FAILED(g_pCurrentServer->Quit())) {
        LogErrorNoThrow("Server call of Quit failed");
    }
}

void __cdecl KxReplSetResult(BSTR* pResult, const wchar_t* pszText)
{
    if (pResult == nullptr) {
        return;
    }
    ::SysFreeString(*pResult);
    *pResult = nullptr;
    if (pszText != nullptr) {
        *pResult = ::SysAllocString(pszText);
        if (*pResult == nullptr) {
            LogErrorNoThrow("Cannot copy command result, dropped");
        }
    }
}

wchar_t* __cdecl KxReplGetString(BSTR bstr)
{
    return bstr;
}

void __cdecl KxReplFreeString(BSTR bstr)
{
    ::SysFreeString(bstr);
}

}  // extern "C"
