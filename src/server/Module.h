#pragma once
// The DLL's module object and the small module classes it derives from.
// One instance exists from DLL load to unload: it initializes COM on the
// loading thread, counts live server objects, guards the loading of type
// information with its re-entrant lock, and runs termination callbacks
// (which release process-wide caches) at unload.
#include <windows.h>
#include <objbase.h>
#include <objidl.h>

#include "ReplServer_h.h"

// Construction order of the DLL's globals. GCC runs constructors of lower
// init_priority first and their destructors last, across translation
// units; every global without a priority is constructed after all of these
// and destroyed before them. So the module object outlives every other
// global of the DLL: the output queue (REPL_INIT_OUTPUT_QUEUE, or no
// priority at all) is gone before the module uninitializes COM and runs
// its termination callbacks. The error log's strings live on the C
// runtime's heap, which exists before and after all of these.
#define REPL_INIT_COM_MODULE 1001    // the module's COM record
#define REPL_INIT_BASE_MODULE 1003   // the module's base record
#define REPL_INIT_MODULE 1004        // the module object
#define REPL_INIT_OUTPUT_QUEUE 1005  // g_OutputQueue: destroyed first at unload
#define REPL_INIT_PRIORITY(n) __attribute__((init_priority(n)))

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

// The module's three locks. Builds for the load-failure tests name one of
// them in REPL_FAIL_LOCK_INIT, whose initialization then reports failure.
enum class ModuleLockId : int
{
    ComRecord = 1,
    BaseRecord = 2,
    Module = 3,
};

// A critical section (spin count 0) whose initialization can fail and is
// therefore explicit. Term() deletes it early; the destructor deletes it
// if that has not happened yet.
class CModuleCriticalSection
{
public:
    CModuleCriticalSection() noexcept = default;
    CModuleCriticalSection(const CModuleCriticalSection&) = delete;
    CModuleCriticalSection& operator=(const CModuleCriticalSection&) = delete;
    ~CModuleCriticalSection() { Term(); }

    bool Init(ModuleLockId id) noexcept;
    void Term() noexcept;
    bool IsInitialized() const noexcept { return m_bInit; }
    CRITICAL_SECTION* Native() noexcept { return &m_sec; }

private:
    CRITICAL_SECTION m_sec = {};
    bool m_bInit = false;
};

// ---- object map ------------------------------------------------------------

typedef HRESULT(WINAPI* _ATL_CREATORFUNC)(void* pv, REFIID riid, void** ppv);
typedef HRESULT(WINAPI* _ATL_UPDATEREGISTRY)(BOOL bRegister);
typedef LPCWSTR(WINAPI* _ATL_DESCRIPTIONFUNC)();
struct _ATL_CATMAP_ENTRY
{
    int iType;
    const GUID* pcatid;  // a component category id
};
typedef const _ATL_CATMAP_ENTRY*(WINAPI* _ATL_CATMAPFUNC)();
typedef void(WINAPI* _ATL_OBJECTMAINFUNC)(bool bStarting);

// A class the module knows. Null creator functions make it non-creatable.
struct _ATL_OBJMAP_ENTRY
{
    const CLSID* pclsid;
    _ATL_UPDATEREGISTRY pfnUpdateRegistry;
    _ATL_CREATORFUNC pfnGetClassObject;
    _ATL_CREATORFUNC pfnCreateInstance;
    IUnknown* pCF;       // cached class object
    DWORD dwRegister;    // class registration cookie
    _ATL_DESCRIPTIONFUNC pfnGetObjectDescription;
    _ATL_CATMAPFUNC pfnGetCategoryMap;
    _ATL_OBJECTMAINFUNC pfnObjectMain;
};

// ---- the module's COM record -----------------------------------------------

struct _ATL_COM_MODULE70
{
    UINT cbSize = 0;  // initialization marker
    HINSTANCE m_hInstTypeLib = nullptr;
    _ATL_OBJMAP_ENTRY* m_pObjMapFirst = nullptr;  // [first, last)
    _ATL_OBJMAP_ENTRY* m_pObjMapLast = nullptr;
    CModuleCriticalSection m_csObjMap;
};

class CAtlComModule : public _ATL_COM_MODULE70
{
public:
    CAtlComModule() noexcept;
    ~CAtlComModule();
    CAtlComModule(const CAtlComModule&) = delete;
    CAtlComModule& operator=(const CAtlComModule&) = delete;
};
extern CAtlComModule _AtlComModule;

// ---- the module's base record ----------------------------------------------

struct _ATL_BASE_MODULE70
{
    UINT cbSize = 0;  // initialization marker
    HINSTANCE m_hInst = nullptr;
    HINSTANCE m_hInstResource = nullptr;
    CModuleCriticalSection m_csResource;
};

// Where the module's code and resources live.
class CAtlBaseModule : public _ATL_BASE_MODULE70
{
public:
    CAtlBaseModule() noexcept;
    ~CAtlBaseModule();
    CAtlBaseModule(const CAtlBaseModule&) = delete;
    CAtlBaseModule& operator=(const CAtlBaseModule&) = delete;

    HINSTANCE GetModuleInstance() const noexcept { return m_hInst; }
    HINSTANCE GetResourceInstance() const noexcept { return m_hInstResource; }
};
extern CAtlBaseModule _AtlBaseModule;

// ---- the module object -----------------------------------------------------

struct _ATL_MODULE70
{
    UINT cbSize = 0;  // initialization marker
    LONG m_nLockCnt = 0;
    _ATL_TERMFUNC_ELEM* m_pTermFuncs = nullptr;
    CModuleCriticalSection m_csStaticDataInitAndTypeInfo;
};

// What a registration script registrar offers for replacements (from ATL's
// registrar; this module never registers anything).
MIDL_INTERFACE("e21f8a85-b05d-4243-8183-c7cb405588f7")
IRegistrarBase : public IUnknown
{
    virtual HRESULT STDMETHODCALLTYPE AddReplacement(LPCOLESTR pszKey, LPCOLESTR pszItem) = 0;
    virtual HRESULT STDMETHODCALLTYPE ClearReplacements() = 0;
};

class CAtlModule : public _ATL_MODULE70
{
public:
    CAtlModule() noexcept;
    virtual ~CAtlModule();
    CAtlModule(const CAtlModule&) = delete;
    CAtlModule& operator=(const CAtlModule&) = delete;

    virtual LONG LockModule() noexcept;    // atomic; returns the new count
    virtual LONG UnlockModule() noexcept;  // atomic; returns the new count
    virtual LONG GetModuleLockCount() noexcept;
    // The process's global interface table (COM creates it on first use).
    virtual HRESULT GetGlobalInterfaceTable(IGlobalInterfaceTable** ppGIT) noexcept;
    virtual HRESULT AddRegistrarReplacements(IRegistrarBase* pRegistrar) noexcept = 0;

    // Newest first; S_OK or E_OUTOFMEMORY (list unchanged).
    HRESULT AddTermCallback(_ATL_TERMFUNC pFunc, DWORD_PTR dw) noexcept;
    // Runs and frees every registered callback, newest first.
    void RunTermCallbacks() noexcept;

    // The module lock: re-entrant; guards the termination list and the
    // loading of type information.
    CRITICAL_SECTION* ModuleLock() noexcept { return m_csStaticDataInitAndTypeInfo.Native(); }
    const GUID& LibId() const noexcept { return m_libid; }
    bool IsInitialized() const noexcept { return cbSize != 0; }

protected:
    static GUID m_libid;
};

// The process's module object (null before construction and after destruction).
extern CAtlModule* _pAtlModule;

// Stores the library id of T (T::GetLibraryId) and offers the module's
// (empty) application id to a registrar.
template <class T>
class CAtlModuleT : public CAtlModule
{
public:
    CAtlModuleT() noexcept { m_libid = T::GetLibraryId(); }

    HRESULT AddRegistrarReplacements(IRegistrarBase* pRegistrar) noexcept override
    {
        if (pRegistrar == nullptr) return E_POINTER;
        return pRegistrar->AddReplacement(L"APPID", T::GetAppId());
    }
    static LPCOLESTR GetAppId() noexcept { return L""; }
};

// The module of an in-process server: the thread that loads the DLL enters
// a single-threaded apartment, which the unload leaves again. A failed
// CoInitialize does not stop the load (a thread already in the
// multithreaded apartment serves no run, but may still load the DLL); it
// only withholds the CoUninitialize, which would otherwise tear down the
// loading thread's own COM initialization.
template <class T>
class CAtlDllModuleT : public CAtlModuleT<T>
{
public:
    CAtlDllModuleT() noexcept : m_bCoInitialized(SUCCEEDED(::CoInitialize(nullptr))) {}
    // Runs before the base class releases the termination callbacks.
    ~CAtlDllModuleT() override
    {
        if (m_bCoInitialized) ::CoUninitialize();
    }

private:
    bool m_bCoInitialized;
};

}  // namespace ATL

class CReplServerModule : public ATL::CAtlDllModuleT<CReplServerModule>
{
public:
    static const GUID& GetLibraryId() noexcept { return LIBID_ReplServerLib; }
};
extern CReplServerModule _AtlModule;
