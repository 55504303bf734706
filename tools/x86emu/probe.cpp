// A small Windows program that checks what the test programs rely on in a
// Wine prefix: console output, COM basics, a type library, threads, a
// vectored exception handler that sees OutputDebugString, and C++
// exceptions. Built for both i686 and x86_64; run it under the matching
// Wine loader.
//
//   probe.exe          run every check; exit code 0 when all pass,
//                      otherwise the number of failed checks
//   probe.exe --start  exit 0 at once (used to time process start-up)
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

}  // namespace

int main(int argc, char** argv) {
    if (argc > 1 && std::strcmp(argv[1], "--start") == 0) return 0;

    std::printf("probe: %d-bit process\n", static_cast<int>(sizeof(void*) * 8));
    check(SUCCEEDED(CoInitialize(nullptr)), "CoInitialize");
    check_stream();
    check_bstr();
    check_typelib();
    check_thread();
    check_debug_output();
    check_cxx_exception();
    CoUninitialize();

    if (g_failed == 0)
        std::printf("probe: all %d checks ok\n", g_passed);
    else
        std::printf("probe: %d of %d checks FAILED\n", g_failed, g_passed + g_failed);
    std::fflush(stdout);
    return g_failed;
}
