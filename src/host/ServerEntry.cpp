// KxReplRun: checks the host's arguments, attaches to the client (Base64
// text -> bytes -> stream -> unmarshalled IDispatch), opens the client
// process for the watchdog, and runs the server on the calling thread.
#include <windows.h>
#include <objbase.h>

#include <cstring>
#include <new>
#include <vector>

#include "common/Raii.h"
#include "diag/LogError.h"
#include "host/Base64.h"
#include "host/KxRepl.h"
#include "host/RunServer.h"

namespace {

enum RunResult
{
    kRunEnded = 0,
    kInvalidArgument = 1,
    kCannotAttach = 2,
};

bool IsNoHandle(HANDLE h) noexcept
{
    // The host may pass the 32-bit form of INVALID_HANDLE_VALUE on any bitness.
    ULONG_PTR nValue = reinterpret_cast<ULONG_PTR>(h);
    return h == nullptr || h == INVALID_HANDLE_VALUE || nValue == 0xFFFFFFFFu;
}

// The argument checks, in their documented order; the first failure wins.
bool CheckArguments(const char* pszClient, DWORD dwClientPID, HMODULE hPythonDLL, HANDLE hInterruptPipe,
                    ExecProc pExecProc)
{
    const char* pszInvalid = nullptr;
    if (pszClient == nullptr) {
        pszInvalid = "Invalid argument: pszClient";
    } else if (dwClientPID == 0) {
        pszInvalid = "Invalid argument: dwClientPID";
    } else if (hPythonDLL == nullptr) {
        pszInvalid = "Invalid argument: hPythonDLL";
    } else if (IsNoHandle(hInterruptPipe)) {
        pszInvalid = "Invalid argument: hInterruptPipe";
    } else if (pExecProc == nullptr) {
        pszInvalid = "Invalid argument: pExecProc";
    }
    LogError(pszInvalid);
    return pszInvalid == nullptr;
}

// Unmarshals the client's IDispatch from the decoded marshalling packet.
// Returns null on failure (logged where a message exists).
CComPtr<IDispatch> UnmarshalClient(const unsigned char* pbPacket, int cbPacket)
{
    CGlobalMem block(::GlobalAlloc(GMEM_MOVEABLE | GMEM_NODISCARD, static_cast<SIZE_T>(cbPacket)));
    if (!block) {
        return nullptr;
    }
    void* pvBlock = ::GlobalLock(block.Get());
    if (pvBlock == nullptr) {
        return nullptr;
    }
    std::memcpy(pvBlock, pbPacket, static_cast<size_t>(cbPacket));
    ::GlobalUnlock(block.Get());

    CComPtr<IStream> spStream;
    // The stream does not own the block: it is freed by `block` after the
    // stream has been released (declaration order).
    if (FAILED(::CreateStreamOnHGlobal(block.Get(), FALSE, &spStream))) {
        LogError("Cannot create stream to unmarshal client interface");
        return nullptr;
    }
    CComPtr<IDispatch> spClient;
    HRESULT hr = ::CoUnmarshalInterface(spStream, IID_IDispatch, reinterpret_cast<void**>(&spClient));
    if (FAILED(hr)) {
        LogError("Cannot unmarshal client interface");
        spClient.Release();
    }
    return spClient;
}

int RunEntry(const char* pszClient, DWORD dwClientPID, HMODULE hPythonDLL, HMODULE hPythonComDLL,
             HANDLE hInterruptPipe, ExecProc pExecProc, ExecComProc pExecComProc)
{
    if (!CheckArguments(pszClient, dwClientPID, hPythonDLL, hInterruptPipe, pExecProc)) {
        return kInvalidArgument;
    }
    const size_t cchClient = std::strlen(pszClient);
    std::vector<unsigned char> vecBuffer;
    try {
        vecBuffer.assign(cchClient, 0);
    } catch (const std::bad_alloc&) {
        LogError("Cannot allocate buffer to decode client string");
        return kCannotAttach;
    }
    int cbDecoded = static_cast<int>(vecBuffer.size());
    if (!Base64Decode(pszClient, static_cast<int>(cchClient), vecBuffer.data(), &cbDecoded)) {
        LogError("Cannot decode client string");
        return kCannotAttach;
    }
    CComPtr<IDispatch> spClient = UnmarshalClient(vecBuffer.data(), cbDecoded);
    if (!spClient) {
        return kCannotAttach;
    }
    HANDLE hClientProcess = ::OpenProcess(PROCESS_QUERY_INFORMATION, FALSE, dwClientPID);
    if (hClientProcess == nullptr) {
        LogError("Cannot open client process");
        return kCannotAttach;
    }
    return RunServer(spClient, hClientProcess, hPythonDLL, hPythonComDLL, hInterruptPipe, pExecProc,
                     pExecComProc);
}

}  // namespace

extern "C" int __cdecl KxReplRun(const char* pszClient, DWORD dwClientPID, HMODULE hPythonDLL,
                                 HMODULE hPythonComDLL, HANDLE hInterruptPipe, ExecProc pExecProc,
                                 ExecComProc pExecComProc)
{
    try {
        return RunEntry(pszClient, dwClientPID, hPythonDLL, hPythonComDLL, hInterruptPipe, pExecProc,
                        pExecComProc);
    } catch (...) {
        // Only an exhausted heap gets here (a log line that cannot be
        // allocated); the client was not attached or is already released.
        return kCannotAttach;
    }
}
