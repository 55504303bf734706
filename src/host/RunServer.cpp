// The body of a server run: the worker threads, the server object, the
// message loop that serves the client's calls, and the teardown.
#include "host/RunServer.h"

#include "common/Raii.h"
#include "diag/LogError.h"
#include "host/Bridge.h"
#include "host/RunState.h"
#include "python/Watchdog.h"
#include "python/WorkerThreads.h"
#include "server/ReplServerImpl.h"

namespace {

enum RunResult
{
    kRunEnded = 0,
    kCannotCreateServer = 3,
    kCannotStartThread = 4,
};

// Creates the server object and connects the client. On success the object
// lives on through the references of Init and the client.
bool CreateAndInitServer(IDispatch* pClient, HMODULE hPythonDLL, HMODULE hPythonComDLL, ExecProc pExecProc,
                         ExecComProc pExecComProc)
{
    CComObject<KxCIReplServerImpl>* pObject = nullptr;
    HRESULT hr = CreateServerObject(&pObject);
    if (FAILED(hr) || pObject == nullptr) {
        LogErrorNoThrow("Cannot create server object");
        return false;
    }
    // Our own reference around Init: a failed Init's Release destroys it.
    pObject->AddRef();
    hr = pObject->Init(pClient, hPythonDLL, hPythonComDLL, pExecProc, pExecComProc);
    if (FAILED(hr)) {
        // A Connect refused by the client's process may leave COM holding
        // references to the object it carried; drop them so that this
        // Release destroys the object now, not at process exit.
        ::CoDisconnectObject(static_cast<IReplServer*>(pObject), 0);
    }
    pObject->Release();
    if (FAILED(hr)) {
        LogErrorNoThrow("Cannot Init server object");
        return false;
    }
    return true;
}

// Pumps messages while a server is current. Output queued by other threads
// is sent before every wait.
void RunMessageLoop()
{
    MSG msg;
    while (g_pCurrentServer != nullptr) {
        FlushQueuedOutput();
        if (::GetMessageW(&msg, nullptr, 0, 0) <= 0) {
            break;
        }
        if (msg.message == WM_REPL_QUIT && msg.hwnd == nullptr) {
            if (g_pCurrentServer != nullptr) {
                g_pCurrentServer->Quit();
            }
            continue;
        }
        ::TranslateMessage(&msg);
        ::DispatchMessageW(&msg);
    }
}

// Quit posts WM_QUIT, which the loop leaves in the queue when it ends on the
// cleared server pointer; left there it would end the host's next message
// loop, the next run's included, before it starts.
void DiscardQuitMessage()
{
    MSG msg;
    ::PeekMessageW(&msg, nullptr, WM_QUIT, WM_QUIT, PM_REMOVE);
}

}  // namespace

int RunServer(IDispatch* pClient, HANDLE hClientProcess, HMODULE hPythonDLL, HMODULE hPythonComDLL,
              HANDLE hInterruptPipe, ExecProc pExecProc, ExecComProc pExecComProc)
{
    g_dwMainThreadId = ::GetCurrentThreadId();

    // The threads stop cooperatively when `threads` goes out of scope, on
    // every road out; the client process handle is theirs from here on.
    CWorkerThreads threads;
    if (!threads.Start(hPythonDLL, hInterruptPipe, hClientProcess)) {
        return kCannotStartThread;
    }
    if (!OpenOutputQueue()) {
        LogErrorNoThrow("Cannot create server object");
        return kCannotCreateServer;
    }
    int nResult = kRunEnded;
    try {
        if (CreateAndInitServer(pClient, hPythonDLL, hPythonComDLL, pExecProc, pExecComProc)) {
            RunMessageLoop();
            // A quit message from anybody else ended the loop with the
            // server still current: detach the client now rather than leave
            // it connected to a loop that no longer runs, and leave no stale
            // current server to the next run.
            if (g_pCurrentServer != nullptr) {
                g_pCurrentServer->Quit();
            }
            DiscardQuitMessage();
        } else {
            nResult = kCannotCreateServer;
        }
    } catch (...) {
        // Only an exhausted heap gets here; end the run in order.
        LogErrorNoThrow("Server run ended by an unexpected failure");
    }
    // Teardown order: the queue first (nothing queued is sent any more),
    // then the threads, which never take the queue's lock.
    CloseOutputQueue();
    threads.Stop();
    return nResult;
}
