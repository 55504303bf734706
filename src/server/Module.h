#pragma once
// The DLL's module object and the small module classes it derives from.
// One instance exists from DLL load to unload: it initializes COM on the
// loading thread, counts live server objects, guards the loading of type
// information with its re-entrant lock, and runs termination callbacks
// (which release process-wide caches) at unload.
#include <windows.h>
#include <objbase.h>

namespace ATL {

typedef void(__stdcall* _ATL_TERMFUNC)(DWORD_PTR dw);

// One registered termination callback; the list is newest first.
struct _ATL_TERMFUNC_ELEM
{
    _ATL_TERMFUNC pFunc;
    DWORD_PTR dw;
    _ATL_TERMFUNC_ELEM* pNext;
};

// Set when any module record's lock cannot be initialized; DllMain then
// refuses the load.
extern bool g_bAtlInitFailed;

class CAtlModule
{
public:
    CAtlModule() noexcept;
    virtual ~CAtlModule();

    virtual LONG LockModule() noexcept;    // atomic; returns the new count
    virtual LONG UnlockModule() noexcept;  // atomic; returns the new count
    virtual LONG GetModuleLockCount() noexcept;

    // Newest first; S_OK or E_OUTOFMEMORY (list unchanged).
    HRESULT AddTermCallback(_ATL_TERMFUNC pFunc, DWORD_PTR dw) noexcept;
    // Runs and frees every registered callback, newest first.
    void RunTermCallbacks() noexcept;

    // The module lock: re-entrant; guards the termination list and the
    // loading of type information.
    CRITICAL_SECTION* ModuleLock() noexcept;
    const GUID& LibId() const noexcept;
};

// The process's module object (null before construction and after destruction).
extern CAtlModule* _pAtlModule;

// The module's base record: where its code and resources live.
class CAtlBaseModule
{
public:
    HINSTANCE GetModuleInstance() const noexcept;
    HINSTANCE GetResourceInstance() const noexcept;
};
extern CAtlBaseModule _AtlBaseModule;

}  // namespace ATL

class CReplServerModule;
extern CReplServerModule _AtlModule;
