// The module object, its two records and the object map, with the globals
// defined in the order the loader must construct them.
#include "server/Module.h"

#include <new>

#include "common/Raii.h"

// The start of this very image: the DLL in the product, the program in the
// unit tests (whose own file then carries the type library).
extern "C" IMAGE_DOS_HEADER __ImageBase;

namespace ATL {

namespace {

HINSTANCE OwnInstance() noexcept
{
    return reinterpret_cast<HINSTANCE>(&__ImageBase);
}

// The object map's entry for the server class: known to the module, but
// without class object or creator, so COM can never create it.
HRESULT WINAPI UpdateRegistryNothing(BOOL) noexcept
{
    return S_OK;
}

const _ATL_CATMAP_ENTRY* WINAPI NoCategoryMap() noexcept
{
    return nullptr;
}

void WINAPI IgnoreObjectMain(bool) noexcept {}

_ATL_OBJMAP_ENTRY g_ObjectMap[] = {
    {&CLSID_ReplServer, UpdateRegistryNothing, nullptr, nullptr, nullptr, 0, nullptr, NoCategoryMap,
     IgnoreObjectMain},
};

}  // namespace

// ---- locks -----------------------------------------------------------------

bool CModuleCriticalSection::Init(ModuleLockId id) noexcept
{
#ifdef REPL_FAIL_LOCK_INIT
    if (static_cast<int>(id) == REPL_FAIL_LOCK_INIT) return false;
#else
    static_cast<void>(id);
#endif
    m_bInit = ::InitializeCriticalSectionAndSpinCount(&m_sec, 0) != FALSE;
    return m_bInit;
}

void CModuleCriticalSection::Term() noexcept
{
    if (m_bInit) {
        m_bInit = false;
        ::DeleteCriticalSection(&m_sec);
    }
}

// ---- globals, in construction order ----------------------------------------

// Constant-initialized, so the records below can set them while the loader
// is still constructing.
bool g_bAtlInitFailed = false;
CAtlModule* _pAtlModule = nullptr;
GUID CAtlModule::m_libid = {};

CAtlComModule _AtlComModule REPL_INIT_PRIORITY(REPL_INIT_COM_MODULE);
CAtlBaseModule _AtlBaseModule REPL_INIT_PRIORITY(REPL_INIT_BASE_MODULE);

// ---- COM record --------------------------------------------------------------

CAtlComModule::CAtlComModule() noexcept
{
    m_hInstTypeLib = OwnInstance();
    m_pObjMapFirst = g_ObjectMap;
    m_pObjMapLast = g_ObjectMap + sizeof(g_ObjectMap) / sizeof(g_ObjectMap[0]);
    if (!m_csObjMap.Init(ModuleLockId::ComRecord)) {
        g_bAtlInitFailed = true;
        return;
    }
    cbSize = sizeof(_ATL_COM_MODULE70);
}

CAtlComModule::~CAtlComModule()
{
    if (cbSize == 0) return;
    for (_ATL_OBJMAP_ENTRY* pEntry = m_pObjMapFirst; pEntry != m_pObjMapLast; ++pEntry) {
        if (pEntry->pCF != nullptr) {
            pEntry->pCF->Release();
            pEntry->pCF = nullptr;
        }
    }
    m_csObjMap.Term();
    cbSize = 0;
}

// ---- base record -------------------------------------------------------------

CAtlBaseModule::CAtlBaseModule() noexcept
{
    m_hInst = OwnInstance();
    m_hInstResource = OwnInstance();
    if (!m_csResource.Init(ModuleLockId::BaseRecord)) {
        g_bAtlInitFailed = true;
        return;
    }
    cbSize = sizeof(_ATL_BASE_MODULE70);
}

CAtlBaseModule::~CAtlBaseModule()
{
    if (cbSize == 0) return;
    m_csResource.Term();
    cbSize = 0;
}

// ---- module object -----------------------------------------------------------

CAtlModule::CAtlModule() noexcept
{
    _pAtlModule = this;
    if (!m_csStaticDataInitAndTypeInfo.Init(ModuleLockId::Module)) {
        g_bAtlInitFailed = true;
        return;
    }
    cbSize = sizeof(_ATL_MODULE70);
}

// The derived DLL module has already left COM when this runs, so the
// callbacks release their caches without any apartment of this thread.
CAtlModule::~CAtlModule()
{
    if (_pAtlModule == this) _pAtlModule = nullptr;
    if (cbSize == 0) return;
    if (m_pTermFuncs != nullptr) RunTermCallbacks();
    m_csStaticDataInitAndTypeInfo.Term();
    cbSize = 0;
}

LONG CAtlModule::LockModule() noexcept
{
    return ::InterlockedIncrement(&m_nLockCnt);
}

LONG CAtlModule::UnlockModule() noexcept
{
    return ::InterlockedDecrement(&m_nLockCnt);
}

LONG CAtlModule::GetModuleLockCount() noexcept
{
    return m_nLockCnt;
}

HRESULT CAtlModule::GetGlobalInterfaceTable(IGlobalInterfaceTable** ppGIT) noexcept
{
    if (ppGIT == nullptr) return E_POINTER;
    *ppGIT = nullptr;
    return ::CoCreateInstance(CLSID_StdGlobalInterfaceTable, nullptr, CLSCTX_INPROC_SERVER,
                              IID_IGlobalInterfaceTable, reinterpret_cast<void**>(ppGIT));
}

HRESULT CAtlModule::AddTermCallback(_ATL_TERMFUNC pFunc, DWORD_PTR dw) noexcept
{
    _ATL_TERMFUNC_ELEM* pElem = new (std::nothrow) _ATL_TERMFUNC_ELEM{pFunc, dw, nullptr};
    if (pElem == nullptr) return E_OUTOFMEMORY;
    CCritSecLock lock(ModuleLock());
    pElem->pNext = m_pTermFuncs;
    m_pTermFuncs = pElem;
    return S_OK;
}

// The list is taken whole under the lock; the callbacks then run outside
// it, so that one of them may take the lock itself.
void CAtlModule::RunTermCallbacks() noexcept
{
    _ATL_TERMFUNC_ELEM* pElem = nullptr;
    {
        CCritSecLock lock(ModuleLock());
        pElem = m_pTermFuncs;
        m_pTermFuncs = nullptr;
    }
    while (pElem != nullptr) {
        pElem->pFunc(pElem->dw);
        _ATL_TERMFUNC_ELEM* pNext = pElem->pNext;
        delete pElem;
        pElem = pNext;
    }
}

}  // namespace ATL

// After the two records: the type-library path and the module lock depend
// on them.
CReplServerModule _AtlModule REPL_INIT_PRIORITY(REPL_INIT_MODULE);
