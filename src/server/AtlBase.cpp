#include "server/AtlBase.h"

#include <string>

#include <cwchar>
#include <memory>

PFN_AllocationGate g_pfnAllocationGate = nullptr;
PFN_GetModuleFileNameW g_pfnGetModuleFileNameW = ::GetModuleFileNameW;
PFN_LoadTypeLib g_pfnLoadTypeLib = ::LoadTypeLib;

namespace {

// The type attributes of a type information, given back on scope exit.
class CTypeAttr
{
public:
    explicit CTypeAttr(ITypeInfo* pInfo) noexcept : m_pInfo(pInfo) { m_hr = pInfo->GetTypeAttr(&m_pAttr); }
    CTypeAttr(const CTypeAttr&) = delete;
    CTypeAttr& operator=(const CTypeAttr&) = delete;
    ~CTypeAttr()
    {
        if (SUCCEEDED(m_hr) && m_pAttr != nullptr) m_pInfo->ReleaseTypeAttr(m_pAttr);
    }
    bool IsValid() const noexcept { return SUCCEEDED(m_hr) && m_pAttr != nullptr; }
    const TYPEATTR* operator->() const noexcept { return m_pAttr; }

private:
    ITypeInfo* m_pInfo;
    TYPEATTR* m_pAttr = nullptr;
    HRESULT m_hr;
};

// One function description, given back on scope exit.
class CFuncDesc
{
public:
    CFuncDesc(ITypeInfo* pInfo, UINT nIndex) noexcept : m_pInfo(pInfo) { m_hr = pInfo->GetFuncDesc(nIndex, &m_pDesc); }
    CFuncDesc(const CFuncDesc&) = delete;
    CFuncDesc& operator=(const CFuncDesc&) = delete;
    ~CFuncDesc()
    {
        if (SUCCEEDED(m_hr) && m_pDesc != nullptr) m_pInfo->ReleaseFuncDesc(m_pDesc);
    }
    bool IsValid() const noexcept { return SUCCEEDED(m_hr) && m_pDesc != nullptr; }
    const FUNCDESC* operator->() const noexcept { return m_pDesc; }

private:
    ITypeInfo* m_pInfo;
    FUNCDESC* m_pDesc = nullptr;
    HRESULT m_hr;
};

// A string allocated with CoTaskMemAlloc.
class CCoTaskString
{
public:
    CCoTaskString() noexcept = default;
    CCoTaskString(const CCoTaskString&) = delete;
    CCoTaskString& operator=(const CCoTaskString&) = delete;
    ~CCoTaskString() { ::CoTaskMemFree(m_psz); }
    LPOLESTR* operator&() noexcept { return &m_psz; }
    LPOLESTR Get() const noexcept { return m_psz; }

private:
    LPOLESTR m_psz = nullptr;
};

// The name cache array, freed with its names unless it was published.
struct NameCacheDeleter
{
    int nCount;
    void operator()(NameCacheEntry* pMap) const noexcept
    {
        for (int i = 0; i < nCount; ++i) ::SysFreeString(pMap[i].bstrName);
        delete[] pMap;
    }
};
typedef std::unique_ptr<NameCacheEntry[], NameCacheDeleter> NameCachePtr;

NameCachePtr AllocateNameCache(int nCount) noexcept
{
    size_t cb = sizeof(NameCacheEntry) * static_cast<size_t>(nCount);
    NameCacheEntry* pMap = AllocationAllowed(cb) ? new (std::nothrow) NameCacheEntry[nCount] : nullptr;
    return NameCachePtr(pMap, NameCacheDeleter{nCount});
}

// Prefers the ITypeInfo view of the ITypeInfo2 object when the type
// information hands out a separate object for it.
CComPtr<ITypeInfo> PreferTypeInfo2(ITypeInfo* pInfo) noexcept
{
    CComPtr<ITypeInfo2> spInfo2;
    if (FAILED(pInfo->QueryInterface(IID_ITypeInfo2, reinterpret_cast<void**>(&spInfo2)))) return pInfo;
    CComPtr<IUnknown> spUnk;
    CComPtr<IUnknown> spUnk2;
    pInfo->QueryInterface(IID_IUnknown, reinterpret_cast<void**>(&spUnk));
    spInfo2->QueryInterface(IID_IUnknown, reinterpret_cast<void**>(&spUnk2));
    if (spUnk.Get() != spUnk2.Get()) return CComPtr<ITypeInfo>(spInfo2.Get());
    return pInfo;
}

}  // namespace

// ---- type information ----------------------------------------------------------

HRESULT CComTypeInfoHolder::LoadTypeInfo(LCID lcid) noexcept
{
    if (m_pInfo.load(std::memory_order_acquire) != nullptr && m_pMap.load(std::memory_order_acquire) != nullptr) {
        return S_OK;
    }
    CCritSecLock lock(ATL::_pAtlModule->ModuleLock());
    HRESULT hr = m_pInfo.load() != nullptr ? S_OK : LoadTypeInfoLocked(lcid);
    ITypeInfo* pInfo = m_pInfo.load();
    if (pInfo != nullptr && m_pMap.load() == nullptr) hr = BuildNameCache(pInfo);
    return hr;
}

HRESULT CComTypeInfoHolder::LoadTypeLibrary(LCID lcid, ITypeLib** ppLib) noexcept
{
    bool bOwnFile = ::IsEqualGUID(*m_plibid, ATL::_pAtlModule->LibId()) && m_wMajor == 0xFFFF && m_wMinor == 0xFFFF;
    if (!bOwnFile) return ::LoadRegTypeLib(*m_plibid, m_wMajor, m_wMinor, lcid, ppLib);

    // The library is resource TYPELIB 1 of this very file, so nothing needs
    // to be registered. A path that does not fit is refused, not truncated.
    WCHAR szPath[MAX_PATH];
    DWORD cch = g_pfnGetModuleFileNameW(ATL::_AtlBaseModule.GetModuleInstance(), szPath, MAX_PATH);
    if (cch == 0 || cch == MAX_PATH) return E_FAIL;
    return g_pfnLoadTypeLib(szPath, ppLib);
}

HRESULT CComTypeInfoHolder::LoadTypeInfoLocked(LCID lcid) noexcept
{
    CComPtr<ITypeLib> spLib;
    HRESULT hr = LoadTypeLibrary(lcid, &spLib);
    if (FAILED(hr)) return hr;
    CComPtr<ITypeInfo> spInfo;
    hr = spLib->GetTypeInfoOfGuid(*m_pguid, &spInfo);
    if (FAILED(hr)) return hr;
    m_pInfo.store(PreferTypeInfo2(spInfo).Detach(), std::memory_order_release);
    // Without the callback the cache merely outlives the unload; no reason to fail.
    ATL::_pAtlModule->AddTermCallback(ReleaseTypeInfoCache, reinterpret_cast<DWORD_PTR>(this));
    return hr;
}

HRESULT CComTypeInfoHolder::BuildNameCache(ITypeInfo* pInfo) noexcept
{
    CTypeAttr attr(pInfo);
    if (!attr.IsValid()) return S_OK;  // the lookups go to the type information; retried later
    int nCount = attr->cFuncs;
    m_nCount = nCount;
    if (nCount == 0) return S_OK;

    NameCachePtr spMap = AllocateNameCache(nCount);
    if (!spMap) return E_OUTOFMEMORY;
    for (int i = 0; i < nCount; ++i) {
        CFuncDesc desc(pInfo, static_cast<UINT>(i));
        if (!desc.IsValid()) continue;
        BSTR bstrName = nullptr;
        if (FAILED(pInfo->GetDocumentation(desc->memid, &bstrName, nullptr, nullptr, nullptr))) continue;
        spMap[i].bstrName = bstrName;
        spMap[i].nLen = static_cast<int>(::SysStringLen(bstrName));
        spMap[i].dispid = desc->memid;
    }
    m_pMap.store(spMap.release(), std::memory_order_release);
    return S_OK;
}

bool CComTypeInfoHolder::LookUpCachedName(LPCOLESTR pszName, DISPID* pDispId) const noexcept
{
    const NameCacheEntry* pMap = m_pMap.load(std::memory_order_acquire);
    if (pMap == nullptr) return false;
    size_t cch = std::wcslen(pszName);
    for (int i = m_nCount - 1; i >= 0; --i) {
        const NameCacheEntry& entry = pMap[i];
        // An entry whose lookups failed has no name and must not match "".
        if (entry.bstrName == nullptr || static_cast<size_t>(entry.nLen) != cch) continue;
        if (std::wmemcmp(entry.bstrName, pszName, cch) == 0) {
            *pDispId = entry.dispid;
            return true;
        }
    }
    return false;
}

void __stdcall CComTypeInfoHolder::ReleaseTypeInfoCache(DWORD_PTR dw) noexcept
{
    CComTypeInfoHolder* pHolder = reinterpret_cast<CComTypeInfoHolder*>(dw);
    ITypeInfo* pInfo = pHolder->m_pInfo.exchange(nullptr);
    if (pInfo != nullptr) pInfo->Release();
    NameCachePtr spMap(pHolder->m_pMap.exchange(nullptr), NameCacheDeleter{pHolder->m_nCount});
}

HRESULT CComTypeInfoHolder::GetTypeInfo(UINT nIndex, LCID lcid, ITypeInfo** ppInfo) noexcept
{
    if (nIndex != 0) return DISP_E_BADINDEX;
    if (ppInfo == nullptr) return E_POINTER;
    HRESULT hr = S_OK;
    if (m_pInfo.load(std::memory_order_acquire) == nullptr) hr = LoadTypeInfo(lcid);
    ITypeInfo* pInfo = m_pInfo.load(std::memory_order_acquire);
    *ppInfo = pInfo;
    if (pInfo == nullptr) return hr;
    pInfo->AddRef();
    return S_OK;
}

HRESULT CComTypeInfoHolder::GetIDsOfNames(REFIID, LPOLESTR* rgszNames, UINT cNames, LCID lcid,
                                          DISPID* rgDispId) noexcept
{
    HRESULT hr = LoadTypeInfo(lcid);
    ITypeInfo* pInfo = m_pInfo.load(std::memory_order_acquire);
    if (pInfo == nullptr) return hr;
    bool bSingleName = cNames == 1 && rgszNames != nullptr && rgszNames[0] != nullptr && rgDispId != nullptr;
    if (bSingleName && LookUpCachedName(rgszNames[0], rgDispId)) return S_OK;
    return pInfo->GetIDsOfNames(rgszNames, cNames, rgDispId);
}

HRESULT CComTypeInfoHolder::Invoke(IDispatch* pThis, DISPID dispid, REFIID, LCID lcid, WORD wFlags,
                                   DISPPARAMS* pParams, VARIANT* pVarResult, EXCEPINFO* pExcepInfo,
                                   UINT* puArgErr) noexcept
{
    HRESULT hr = LoadTypeInfo(lcid);
    ITypeInfo* pInfo = m_pInfo.load(std::memory_order_acquire);
    if (pInfo == nullptr) return hr;
    return pInfo->Invoke(pThis, dispid, wFlags, pParams, pVarResult, pExcepInfo, puArgErr);
}

// ---- error objects -----------------------------------------------------------------

namespace {

// The ProgID registered for a class, looked up once per class: under Wine
// every lookup of an unregistered class leaks a registry key handle, and
// a failing command reports an error each time.
bool CachedProgIdFromClsid(REFCLSID clsid, std::wstring* pstrProgId)
{
    static SRWLOCK s_srwLock = SRWLOCK_INIT;
    static CLSID s_clsid = GUID_NULL;
    static bool s_bLooked = false;
    static bool s_bFound = false;
    static std::wstring s_strProgId;
    CSrwExclusiveLock lock(&s_srwLock);
    if (!s_bLooked || !IsEqualGUID(s_clsid, clsid)) {
        CCoTaskString pszProgId;
        s_bFound = SUCCEEDED(::ProgIDFromCLSID(clsid, &pszProgId));
        s_strProgId = s_bFound ? pszProgId.Get() : L"";
        s_clsid = clsid;
        s_bLooked = true;
    }
    *pstrProgId = s_strProgId;
    return s_bFound;
}

}  // namespace

HRESULT ReportErrorInfo(const CLSID& clsid, LPCOLESTR pszDescription, const IID& iid, HRESULT hr) noexcept
{
    CComPtr<ICreateErrorInfo> spCreate;
    if (SUCCEEDED(::CreateErrorInfo(&spCreate))) {
        spCreate->SetGUID(iid);
        std::wstring strProgId;
        if (CachedProgIdFromClsid(clsid, &strProgId)) spCreate->SetSource(const_cast<LPOLESTR>(strProgId.c_str()));
        spCreate->SetDescription(const_cast<LPOLESTR>(pszDescription));
        CComPtr<IErrorInfo> spInfo;
        if (SUCCEEDED(spCreate->QueryInterface(IID_IErrorInfo, reinterpret_cast<void**>(&spInfo)))) {
            ::SetErrorInfo(0, spInfo);
        }
    }
    return hr == S_OK ? DISP_E_EXCEPTION : hr;
}
