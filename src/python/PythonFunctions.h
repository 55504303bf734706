#pragma once
// The Python entry points the server calls, found by exported name in the
// module handles the host passes in. The server links no Python library.
#include <windows.h>
#include <oaidl.h>

struct _object;
typedef struct _object PyObject;
typedef int PyGILState_STATE;

typedef void(__cdecl* PFN_Py_DecRef)(PyObject*);
typedef PyGILState_STATE(__cdecl* PFN_PyGILState_Ensure)();
typedef void(__cdecl* PFN_PyGILState_Release)(PyGILState_STATE);
typedef void(__cdecl* PFN_PyErr_SetInterrupt)();
typedef PyObject*(__cdecl* PFN_PyCom_PyObjectFromVariant)(const VARIANT*);
typedef BOOL(__cdecl* PFN_PyCom_VariantFromPyObject)(PyObject*, VARIANT*);
typedef int(__cdecl* PFN_PyThreadState_SetAsyncExc)(unsigned long, PyObject*);

// The table a server object binds once. All six entries are set or all
// are null; whether it is bound is read from the conversion entry.
struct PythonFunctions
{
    PFN_Py_DecRef Py_DecRef = nullptr;
    PFN_PyGILState_Ensure PyGILState_Ensure = nullptr;
    PFN_PyGILState_Release PyGILState_Release = nullptr;
    PFN_PyErr_SetInterrupt PyErr_SetInterrupt = nullptr;
    PFN_PyCom_PyObjectFromVariant PyCom_PyObjectFromVariant = nullptr;
    PFN_PyCom_VariantFromPyObject PyCom_VariantFromPyObject = nullptr;

    bool IsBound() const noexcept { return PyCom_PyObjectFromVariant != nullptr; }
};

// Fills the table from the two modules, all or nothing. A null handle
// leaves it untouched. Never logs.
void BindPythonFunctions(PythonFunctions& python, HMODULE hPythonDLL, HMODULE hPythonComDLL) noexcept;

// Looks a name up in a module as a function pointer of type T.
template <class T>
T GetPythonProc(HMODULE hModule, const char* pszName) noexcept
{
    return reinterpret_cast<T>(reinterpret_cast<void*>(::GetProcAddress(hModule, pszName)));
}

// Holds the interpreter lock for one scope, on one thread: the release
// always goes to the same thread with the state its ensure returned.
class CGilLock
{
public:
    CGilLock(PFN_PyGILState_Ensure pfnEnsure, PFN_PyGILState_Release pfnRelease) noexcept
        : m_pfnRelease(pfnRelease), m_state(pfnEnsure())
    {
    }
    explicit CGilLock(const PythonFunctions& python) noexcept
        : CGilLock(python.PyGILState_Ensure, python.PyGILState_Release)
    {
    }
    CGilLock(const CGilLock&) = delete;
    CGilLock& operator=(const CGilLock&) = delete;
    ~CGilLock() { m_pfnRelease(m_state); }

private:
    PFN_PyGILState_Release m_pfnRelease;
    PyGILState_STATE m_state;
};
