// Test doubles of the Python runtime DLL (PyRuntimeDouble.dll, and the
// variant PyRuntimeNoInterrupt.dll that lacks PyErr_SetInterrupt) and of the
// Python COM-support DLL (PyComDouble.dll).
//
// The server reaches Python only by export name, so these DLLs stand in for
// CPython at exactly that boundary. The Python-facing exports behave like
// CPython's where the server relies on them; the TestPy_* / TestPyCom_*
// exports let tests drive the "interpreter" and read what the server did.
//
// Link the import library of PyRuntimeDouble / PyComDouble to call them
// directly, or load a DLL with LoadLibrary and use PYDOUBLE_PROC (needed for
// PyRuntimeNoInterrupt, whose state is separate from PyRuntimeDouble's).
#pragma once

#include <windows.h>
#include <oaidl.h>

#if defined(PYDOUBLE_BUILD_RUNTIME)
#define PYDOUBLE_API __declspec(dllexport)
#else
#define PYDOUBLE_API __declspec(dllimport)
#endif

#if defined(PYDOUBLE_BUILD_COM)
#define PYCOMDOUBLE_API __declspec(dllexport)
#else
#define PYCOMDOUBLE_API __declspec(dllimport)
#endif

// Opaque, declared the way CPython's own headers declare it.
typedef struct _object PyObject;

// PyGILState_STATE values, as in CPython.
enum
{
    PYDOUBLE_GIL_LOCKED = 0,    // the thread already held the lock
    PYDOUBLE_GIL_UNLOCKED = 1,  // the matching release frees the lock
};

// What TestPy_Kind reports.
enum
{
    PYDOUBLE_KIND_INVALID = 0,  // null, freed, or not made by the double
    PYDOUBLE_KIND_NONE = 1,
    PYDOUBLE_KIND_INT = 2,
    PYDOUBLE_KIND_STR = 3,
    PYDOUBLE_KIND_UNCONVERTIBLE = 4,  // no conversion to a VARIANT exists
    PYDOUBLE_KIND_TYPE = 5,           // the KeyboardInterrupt type object
};

extern "C" {

// ---- Python runtime entry points (CPython behaviour) -----------------------

// Recursive interpreter lock, usable from any thread. Returns
// PYDOUBLE_GIL_UNLOCKED when the thread did not hold the lock before.
PYDOUBLE_API int __cdecl PyGILState_Ensure(void);
// Undoes the matching Ensure of the same thread; frees the lock on UNLOCKED.
PYDOUBLE_API void __cdecl PyGILState_Release(int nState);
// Makes an interrupt pending (absent from PyRuntimeNoInterrupt.dll).
PYDOUBLE_API void __cdecl PyErr_SetInterrupt(void);
// 1 (or the TestPy_SetAsyncExcResult override) for a registered thread,
// 0 otherwise; a null pExc withdraws the thread's pending exception.
PYDOUBLE_API int __cdecl PyThreadState_SetAsyncExc(unsigned long dwThreadId, PyObject* pExc);
// Drops one reference; frees at zero. Null is ignored.
PYDOUBLE_API void __cdecl Py_DecRef(PyObject* pObj);
// Exported data: holds the KeyboardInterrupt type object (non-null).
PYDOUBLE_API extern PyObject* PyExc_KeyboardInterrupt;

// ---- Runtime test API --------------------------------------------------------
// Counters are cumulative since the last TestPy_Reset. Functions that read an
// object count a reference error when it is freed or foreign.

// Forgets counters, call log, registrations, pending interrupts, overrides and
// lock state; frees objects already freed by refcount. Objects still alive stay
// alive. Call only while no other thread uses the double.
PYDOUBLE_API void __cdecl TestPy_Reset(void);

// New references (refcount 1), or null when out of memory.
PYDOUBLE_API PyObject* __cdecl TestPy_NewNone(void);
PYDOUBLE_API PyObject* __cdecl TestPy_NewInt(long long nValue);
PYDOUBLE_API PyObject* __cdecl TestPy_NewStr(const wchar_t* psz);  // null -> ""
PYDOUBLE_API PyObject* __cdecl TestPy_NewStrN(const wchar_t* pwch, int cch);
PYDOUBLE_API PyObject* __cdecl TestPy_NewUnconvertible(void);

PYDOUBLE_API int __cdecl TestPy_Kind(PyObject* pObj);            // PYDOUBLE_KIND_*
PYDOUBLE_API long long __cdecl TestPy_Int(PyObject* pObj);       // 0 unless int
PYDOUBLE_API const wchar_t* __cdecl TestPy_Str(PyObject* pObj);  // null unless str
PYDOUBLE_API int __cdecl TestPy_StrLen(PyObject* pObj);          // -1 unless str
PYDOUBLE_API long __cdecl TestPy_RefCount(PyObject* pObj);       // -1 if invalid
PYDOUBLE_API void __cdecl TestPy_IncRef(PyObject* pObj);
PYDOUBLE_API long __cdecl TestPy_LiveObjects(void);  // excludes the static type
// Py_DecRef/IncRef/reads of a freed or foreign object; refcount reaching 0 on
// the static type object.
PYDOUBLE_API long __cdecl TestPy_RefErrors(void);

PYDOUBLE_API DWORD __cdecl TestPy_GilOwner(void);  // thread id, 0 when free
PYDOUBLE_API int __cdecl TestPy_GilDepth(void);
PYDOUBLE_API long __cdecl TestPy_EnsureCalls(void);
PYDOUBLE_API long __cdecl TestPy_ReleaseCalls(void);
// Releases by a thread that does not hold the lock, or with a state that does
// not match the nesting (such a release changes nothing).
PYDOUBLE_API long __cdecl TestPy_GilErrors(void);
// Py_DecRef, PyErr_SetInterrupt, PyThreadState_SetAsyncExc and the PyCom_*
// conversions called by a thread that does not hold the lock.
PYDOUBLE_API long __cdecl TestPy_LockViolations(void);
// 1 if the calling thread holds the lock, else counts a violation and returns
// 0. For the COM double.
PYDOUBLE_API int __cdecl TestPy_RequireLock(void);

PYDOUBLE_API long __cdecl TestPy_InterruptCalls(void);
PYDOUBLE_API int __cdecl TestPy_InterruptPending(void);  // peek, no clear
// The interpreter's periodic check, for a test host's "running code" loop: if
// the caller holds the lock and another thread waits for it, hands the lock
// over once (CPython's switch interval), then returns 1 and clears a pending
// interrupt, else 0.
PYDOUBLE_API int __cdecl TestPy_CheckInterrupt(void);
// Blocks up to dwMs for a pending interrupt, then clears it and returns 1
// (0 on timeout). Holds no lock while it waits, like a blocking call in Python.
PYDOUBLE_API int __cdecl TestPy_WaitInterrupt(DWORD dwMs);

// The calling thread runs Python code, so PyThreadState_SetAsyncExc reaches it.
PYDOUBLE_API int __cdecl TestPy_RegisterThread(void);  // 0 when out of memory
PYDOUBLE_API void __cdecl TestPy_UnregisterThread(void);
// Returns 1 and clears if the calling thread has a pending async exception.
PYDOUBLE_API int __cdecl TestPy_CheckAsyncExc(void);
// Blocks up to dwMs for one, lock released meanwhile; 1 = got and cleared it.
PYDOUBLE_API int __cdecl TestPy_WaitAsyncExc(DWORD dwMs);
// Log of PyThreadState_SetAsyncExc calls, in order.
PYDOUBLE_API int __cdecl TestPy_AsyncCallCount(void);
// Entry nIndex: thread id and exception argument (null = withdraw). 0 if no
// such entry. Either out pointer may be null.
PYDOUBLE_API int __cdecl TestPy_AsyncCall(int nIndex, DWORD* pdwThreadId, PyObject** ppExc);
// Result for registered threads; 0 restores the normal 1.
PYDOUBLE_API void __cdecl TestPy_SetAsyncExcResult(int nResult);

// Nonzero: PyExc_KeyboardInterrupt holds null; zero: the type object again.
PYDOUBLE_API void __cdecl TestPy_SetKeyboardInterruptNull(int bNull);

// ---- Python COM-support entry points ----------------------------------------

// VT_EMPTY -> None; VT_I2, VT_I4 -> int; VT_BOOL -> int 1/0; VT_BSTR -> str
// (copy, null BSTR -> ""); anything else -> null. Returns a new reference.
PYCOMDOUBLE_API PyObject* __cdecl PyCom_PyObjectFromVariant(const VARIANT* pVar);
// None -> VT_EMPTY; int in 32-bit range -> VT_I4; str -> VT_BSTR (new
// BSTR); anything else, or out of memory -> FALSE with pVar untouched.
PYCOMDOUBLE_API BOOL __cdecl PyCom_VariantFromPyObject(PyObject* pObj, VARIANT* pVar);

// ---- COM-support test API ----------------------------------------------------
PYCOMDOUBLE_API void __cdecl TestPyCom_Reset(void);
PYCOMDOUBLE_API long __cdecl TestPyCom_FromVariantCalls(void);
PYCOMDOUBLE_API long __cdecl TestPyCom_ToVariantCalls(void);
PYCOMDOUBLE_API long __cdecl TestPyCom_BstrAllocs(void);  // BSTRs handed out

}  // extern "C"

// Typed lookup in a double loaded with LoadLibrary, e.g.
//   auto pfnReset = PYDOUBLE_PROC(hModule, TestPy_Reset);
// Null when the module does not export the name.
template <typename T>
inline T PyDoubleProcAs(HMODULE hModule, const char* pszName)
{
    // Through void(*)() so that the cast from FARPROC stays warning-free.
    return reinterpret_cast<T>(reinterpret_cast<void (*)()>(GetProcAddress(hModule, pszName)));
}
#define PYDOUBLE_PROC(hModule, name) PyDoubleProcAs<decltype(&name)>((hModule), #name)
