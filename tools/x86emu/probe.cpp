// A small Windows program that checks what the test programs rely on in a
// Wine prefix: console output, COM basics, a type library, threads, a
// vectored exception handler that sees OutputDebugString, and C++
// exceptions. Built for both i686 and x86_64; run it under the matching
// Wine loader.
//
//   probe.exe          run every check; exit code 0 when all pass,
//                      otherwise the number of failed checks
//   probe.exe --start  exit 0 at once (used to time process start-up)
//   probe.exe --crash  write through a null pointer (the process must die)
//   probe.exe --run <program> [argument]
//                      start another program (of either architecture), wait
//                      up to 100 s for it and exit with its exit code
#include <windows.h>
#include <ole2.h>
#include <oleauto.h>

#include <cstdio>
#include <cstring>
#include <stdexcept>
#include <string>

namespace {

int g_failed = 0;
int g_passed = 0;

void check(bool ok, const char* what) {
    if (ok) {
        ++g_passed;
    } else {
        ++g_failed;
        std::printf("FAILED: %s\n", what);
    }
}

// --- COM: a memory stream written and read back --------------------------
void check_stream() {
    IStream* stream = nullptr;
    HRESULT hr = CreateStreamOnHGlobal(nullptr, TRUE, &stream);
    check(SUCCEEDED(hr) && stream, "CreateStreamOnHGlobal");
    if (!stream) return;
    const char text[] = "round trip";
    ULONG n = 0;
    check(SUCCEEDED(stream->Write(text, sizeof text, &n)) && n == sizeof text, "IStream::Write");
    LARGE_INTEGER zero = {};
    check(SUCCEEDED(stream->Seek(zero, STREAM_SEEK_SET, nullptr)), "IStream::Seek");
    char back[sizeof text] = {};
    check(SUCCEEDED(stream->Read(back, sizeof back, &n)) && n == sizeof text &&
              std::memcmp(back, text, sizeof text) == 0,
          "IStream::Read returns what was written");
    stream->Release();
}

// --- BSTR lengths (the length prefix is 4 bytes on both architectures) ---
void check_bstr() {
    BSTR s = SysAllocString(L"probe");
    check(s && SysStringLen(s) == 5 && SysStringByteLen(s) == 10, "SysAllocString lengths");
    check(s && reinterpret_cast<const UINT*>(s)[-1] == 10, "BSTR byte-length prefix");
    SysFreeString(s);
}

// --- a type library: IDispatch from stdole2 has seven vtable slots -------
// Its vtable size is 7 * sizeof(void*): 28 bytes in a 32-bit process,
// 56 in a 64-bit one.
void check_typelib() {
    ITypeLib* lib = nullptr;
    HRESULT hr = LoadTypeLib(L"stdole2.tlb", &lib);
    check(SUCCEEDED(hr) && lib, "LoadTypeLib(stdole2.tlb)");
    if (!lib) return;
    ITypeInfo* info = nullptr;
    hr = lib->GetTypeInfoOfGuid(IID_IDispatch, &info);
    check(SUCCEEDED(hr) && info, "stdole2 describes IDispatch");
    if (info) {
        TYPEATTR* attr = nullptr;
        if (SUCCEEDED(info->GetTypeAttr(&attr))) {
            check(attr->cbSizeVft == 7 * sizeof(void*), "IDispatch vtable size is 7 pointers");
            info->ReleaseTypeAttr(attr);
        } else {
            check(false, "ITypeInfo::GetTypeAttr");
        }
        info->Release();
    }
    lib->Release();
}

// --- a thread, waited for with a timeout ---------------------------------
DWORD WINAPI thread_main(void* arg) {
    *static_cast<LONG*>(arg) = 42;
    return 7;
}

void check_thread() {
    LONG value = 0;
    HANDLE t = CreateThread(nullptr, 0, thread_main, &value, 0, nullptr);
    check(t != nullptr, "CreateThread");
    if (!t) return;
    check(WaitForSingleObject(t, 10000) == WAIT_OBJECT_0, "thread ends within 10 s");
    DWORD code = 0;
    check(GetExitCodeThread(t, &code) && code == 7 && value == 42, "thread result");
    CloseHandle(t);
}

// --- OutputDebugString seen by a vectored exception handler --------------
std::string g_debug_line;

LONG CALLBACK debug_handler(EXCEPTION_POINTERS* ep) {
    const EXCEPTION_RECORD* r = ep->ExceptionRecord;
    if (r->ExceptionCode == DBG_PRINTEXCEPTION_C && r->NumberParameters >= 2) {
        g_debug_line.assign(reinterpret_cast<const char*>(r->ExceptionInformation[1]),
                            static_cast<size_t>(r->ExceptionInformation[0]));
        return EXCEPTION_CONTINUE_EXECUTION;
    }
    return EXCEPTION_CONTINUE_SEARCH;
}

void check_debug_output() {
    void* h = AddVectoredExceptionHandler(1, debug_handler);
    check(h != nullptr, "AddVectoredExceptionHandler");
    OutputDebugStringA("probe line");
    if (h) RemoveVectoredExceptionHandler(h);
    // The length passed includes the terminating null.
    check(g_debug_line == std::string("probe line", 11), "OutputDebugStringA reaches the handler");
}

// --- C++ exceptions: thrown through a frame whose destructor must run ----
int g_destroyed = 0;
struct Guard {
    ~Guard() { ++g_destroyed; }
};

__attribute__((noinline)) void throw_through(int depth) {
    Guard g;
    if (depth == 0) throw std::runtime_error("deep");
    throw_through(depth - 1);
}

void check_cxx_exception() {
    std::string caught;
    try {
        throw_through(3);
    } catch (const std::runtime_error& e) {
        caught = e.what();
    }
    check(caught == "deep" && g_destroyed == 4, "C++ exception unwinds four frames");
}

// --- many threads, each raising exceptions, and a suspended thread ------
// Every thread's own thread-local storage and TEB must stay its own through
// exception dispatch and signals; more threads than the 511 private
// segment entries that the emulation shim hands out, so entries are reused.
volatile LONG g_worker_ok = 0;

DWORD g_tls_slot = TLS_OUT_OF_INDEXES;

// True when the TEB that this thread sees is its own: its stack bounds
// hold a local variable, and its TLS slot holds what this thread put there.
bool own_teb(void* mine) {
    const NT_TIB* tib = reinterpret_cast<const NT_TIB*>(NtCurrentTeb());
    char here;
    return tib->StackLimit <= static_cast<void*>(&here) && static_cast<void*>(&here) < tib->StackBase &&
           TlsGetValue(g_tls_slot) == mine;
}

DWORD WINAPI worker_main(void*) {
    int mine = 0;
    TlsSetValue(g_tls_slot, &mine);
    bool ok = own_teb(&mine);
    try {
        throw_through(2);
    } catch (const std::runtime_error&) {
        ok = ok && own_teb(&mine);
    }
    RaiseException(0xE0000001, 0, 0, nullptr);  // continued by counting_handler
    ok = ok && own_teb(&mine);
    Sleep(1);
    ok = ok && own_teb(&mine);
    if (ok) InterlockedIncrement(&g_worker_ok);
    return 0;
}

volatile LONG g_raised = 0;

LONG CALLBACK counting_handler(EXCEPTION_POINTERS* ep) {
    if (ep->ExceptionRecord->ExceptionCode != 0xE0000001) return EXCEPTION_CONTINUE_SEARCH;
    InterlockedIncrement(&g_raised);
    return EXCEPTION_CONTINUE_EXECUTION;
}

DWORD WINAPI spin_main(void* arg) {
    while (!*static_cast<volatile LONG*>(arg)) {
    }
    return 0;
}

void check_many_threads() {
    const int batches = 40, per_batch = 16;
    g_tls_slot = TlsAlloc();
    check(g_tls_slot != TLS_OUT_OF_INDEXES, "TlsAlloc");
    void* h = AddVectoredExceptionHandler(1, counting_handler);
    bool all_done = true;
    for (int b = 0; b < batches; ++b) {
        HANDLE t[per_batch];
        int n = 0;
        for (int i = 0; i < per_batch; ++i)
            if ((t[n] = CreateThread(nullptr, 0, worker_main, nullptr, 0, nullptr))) ++n;
        if (n == 0 || WaitForMultipleObjects(n, t, TRUE, 30000) != WAIT_OBJECT_0) all_done = false;
        for (int i = 0; i < n; ++i) CloseHandle(t[i]);
    }
    RaiseException(0xE0000001, 0, 0, nullptr);  // and once more in this thread
    if (h) RemoveVectoredExceptionHandler(h);
    check(all_done, "640 threads end within 30 s per batch of 16");
    check(g_worker_ok == batches * per_batch, "every thread kept its own TEB through exceptions");
    check(g_raised == batches * per_batch + 1, "every raised exception reached the handler");

    // Suspending a thread and reading its context goes through a signal.
    LONG stop = 0;
    HANDLE s = CreateThread(nullptr, 0, spin_main, &stop, 0, nullptr);
    bool ok = s != nullptr;
    for (int i = 0; ok && i < 20; ++i) {
        CONTEXT ctx = {};
        ctx.ContextFlags = CONTEXT_CONTROL;
        ok = SuspendThread(s) != (DWORD)-1 && GetThreadContext(s, &ctx);
#ifdef _WIN64
        ok = ok && ctx.Rsp != 0;
#else
        ok = ok && ctx.Esp != 0;
#endif
        ok = ResumeThread(s) != (DWORD)-1 && ok;
    }
    InterlockedExchange(&stop, 1);
    ok = ok && WaitForSingleObject(s, 10000) == WAIT_OBJECT_0;
    if (s) CloseHandle(s);
    check(ok, "suspend, read the context of and resume a running thread");
}

}  // namespace

// Starts a program and waits for it; its exit code, or 255 on failure.
int run_program(const char* program, const char* argument) {
    std::string cmd = std::string("\"") + program + "\"";
    if (argument) cmd += std::string(" ") + argument;
    STARTUPINFOA si = {};
    si.cb = sizeof si;
    PROCESS_INFORMATION pi = {};
    if (!CreateProcessA(nullptr, &cmd[0], nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si, &pi)) {
        std::printf("probe: cannot start %s (error %lu)\n", program, GetLastError());
        return 255;
    }
    DWORD code = 255;
    if (WaitForSingleObject(pi.hProcess, 100000) != WAIT_OBJECT_0) {
        std::printf("probe: %s did not end within 100 s\n", program);
        TerminateProcess(pi.hProcess, 255);
    } else {
        GetExitCodeProcess(pi.hProcess, &code);
    }
    CloseHandle(pi.hThread);
    CloseHandle(pi.hProcess);
    return static_cast<int>(code);
}

int main(int argc, char** argv) {
    if (argc > 1 && std::strcmp(argv[1], "--start") == 0) return 0;
    if (argc > 1 && std::strcmp(argv[1], "--crash") == 0) {
        *static_cast<volatile int*>(nullptr) = 1;
        return 0;
    }
    if (argc > 2 && std::strcmp(argv[1], "--run") == 0)
        return run_program(argv[2], argc > 3 ? argv[3] : nullptr);

    std::printf("probe: %d-bit process\n", static_cast<int>(sizeof(void*) * 8));
    check(SUCCEEDED(CoInitialize(nullptr)), "CoInitialize");
    check_stream();
    check_bstr();
    check_typelib();
    check_thread();
    check_debug_output();
    check_cxx_exception();
    check_many_threads();
    CoUninitialize();

    if (g_failed == 0)
        std::printf("probe: all %d checks ok\n", g_passed);
    else
        std::printf("probe: %d of %d checks FAILED\n", g_failed, g_passed + g_failed);
    std::fflush(stdout);
    return g_failed;
}
