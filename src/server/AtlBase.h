#pragma once
// The small COM class library the server object is built from: reference
// counting, the interface table and QueryInterface, IDispatch served from the
// DLL's own type library with a name cache in front of it, ISupportErrorInfo,
// creation and destruction, and the error object of a failed command.
//
// Written for exactly what this DLL needs: one single-threaded class with a
// dual interface, created directly (no class factory, no registration).
#include <windows.h>
#include <oleauto.h>

#include <atomic>
#include <climits>
#include <cstddef>
#include <new>

#include "common/Raii.h"
#include "server/Module.h"

// ---- allocation --------------------------------------------------------------

// Every allocation of this layer asks the gate first, so that tests can
// simulate exhausted memory. Null (the default) allows everything.
typedef bool (*PFN_AllocationGate)(size_t cb) noexcept;
extern PFN_AllocationGate g_pfnAllocationGate;

inline bool AllocationAllowed(size_t cb) noexcept
{
    return g_pfnAllocationGate == nullptr || g_pfnAllocationGate(cb);
}

// ---- reference counting and the interface table --------------------------------

// Objects of this model live in one single-threaded apartment: plain counts.
class CComSingleThreadModel
{
public:
    static ULONG Increment(LONG* p) noexcept { return static_cast<ULONG>(++*p); }
    static ULONG Decrement(LONG* p) noexcept { return static_cast<ULONG>(--*p); }
};

// One row of a class's interface table: an interface id and the face of the
// object that answers it. A row with a null id ends the table.
template <class T>
struct InterfaceMapEntry
{
    const IID* piid;
    IUnknown* (*pfnFace)(T* pThis) noexcept;
};

// The face of interface I of an object of class T.
template <class T, class I>
IUnknown* InterfaceFace(T* pThis) noexcept
{
    return static_cast<I*>(pThis);
}

class CComObjectRootBase
{
public:
    // Construction and destruction hooks of a concrete class; the defaults do nothing.
    HRESULT FinalConstruct() noexcept { return S_OK; }
    void FinalRelease() noexcept {}

    // QueryInterface over an interface table: IUnknown is the first row's
    // face; every face shares the object's one count.
    template <class T>
    static HRESULT InternalQueryInterface(T* pThis, const InterfaceMapEntry<T>* pEntries, REFIID riid,
                                          void** ppv) noexcept
    {
        if (ppv == nullptr) return E_POINTER;
        *ppv = nullptr;
        if (::IsEqualGUID(riid, IID_IUnknown)) return HandOut(pEntries->pfnFace(pThis), ppv);
        for (const InterfaceMapEntry<T>* pEntry = pEntries; pEntry->piid != nullptr; ++pEntry) {
            if (::IsEqualGUID(riid, *pEntry->piid)) return HandOut(pEntry->pfnFace(pThis), ppv);
        }
        return E_NOINTERFACE;
    }

    LONG m_dwRef = 0;

private:
    static HRESULT HandOut(IUnknown* pFace, void** ppv) noexcept
    {
        pFace->AddRef();
        *ppv = pFace;
        return S_OK;
    }
};

template <class ThreadModel>
class CComObjectRootEx : public CComObjectRootBase
{
public:
    ULONG InternalAddRef() noexcept { return ThreadModel::Increment(&m_dwRef); }
    ULONG InternalRelease() noexcept { return ThreadModel::Decrement(&m_dwRef); }
};

// ---- error objects -------------------------------------------------------------

// Installs an error object (the interface id, the description, and the
// class's registered ProgID as source when one exists) as the calling
// thread's current error, and returns hr, or DISP_E_EXCEPTION for 0. The
// result does not depend on whether the error object could be made.
HRESULT ReportErrorInfo(const CLSID& clsid, LPCOLESTR pszDescription, const IID& iid, HRESULT hr) noexcept;

template <class T, const CLSID* pclsid>
class CComCoClass
{
public:
    static const CLSID& GetObjectCLSID() noexcept { return *pclsid; }
    static HRESULT Error(LPCOLESTR pszDescription, const IID& iid, HRESULT hr) noexcept
    {
        return ReportErrorInfo(*pclsid, pszDescription, iid, hr);
    }
};

// ---- type information ------------------------------------------------------------

// One member name of the dispatch interface, for single-name lookups that
// need not go into the type information.
struct NameCacheEntry
{
    BSTR bstrName = nullptr;  // owned by the cache
    int nLen = 0;             // UTF-16 units
    DISPID dispid = -1;
};

// The type information of one dispatch interface, loaded once per process
// (under the module lock) and kept until the DLL unloads.
class CComTypeInfoHolder
{
public:
    constexpr CComTypeInfoHolder(const GUID* pguid, const GUID* plibid, WORD wMajor, WORD wMinor) noexcept
        : m_pguid(pguid), m_plibid(plibid), m_wMajor(wMajor), m_wMinor(wMinor)
    {
    }
    CComTypeInfoHolder(const CComTypeInfoHolder&) = delete;
    CComTypeInfoHolder& operator=(const CComTypeInfoHolder&) = delete;

    HRESULT GetTypeInfo(UINT nIndex, LCID lcid, ITypeInfo** ppInfo) noexcept;
    HRESULT GetIDsOfNames(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID lcid, DISPID* rgDispId) noexcept;
    HRESULT Invoke(IDispatch* pThis, DISPID dispid, REFIID riid, LCID lcid, WORD wFlags, DISPPARAMS* pParams,
                   VARIANT* pVarResult, EXCEPINFO* pExcepInfo, UINT* puArgErr) noexcept;

    // Makes sure the type information and the name cache are present.
    HRESULT LoadTypeInfo(LCID lcid) noexcept;
    // Fills the name cache from pInfo; call with the module lock held.
    HRESULT BuildNameCache(ITypeInfo* pInfo) noexcept;
    // Termination callback: drops both caches (dw is the holder).
    static void __stdcall ReleaseTypeInfoCache(DWORD_PTR dw) noexcept;

    const GUID* m_pguid;
    const GUID* m_plibid;
    WORD m_wMajor;
    WORD m_wMinor;
    // Both published once under the module lock and read without it.
    std::atomic<ITypeInfo*> m_pInfo{nullptr};
    LONG m_dwRef = 0;  // unused; the holder is static
    std::atomic<NameCacheEntry*> m_pMap{nullptr};
    int m_nCount = 0;

private:
    HRESULT LoadTypeLibrary(LCID lcid, ITypeLib** ppLib) noexcept;
    HRESULT LoadTypeInfoLocked(LCID lcid) noexcept;
    bool LookUpCachedName(LPCOLESTR pszName, DISPID* pDispId) const noexcept;
};

// Where the type library comes from; tests replace these to count loads or
// to make them fail.
typedef DWORD(WINAPI* PFN_GetModuleFileNameW)(HMODULE, LPWSTR, DWORD);
typedef HRESULT(WINAPI* PFN_LoadTypeLib)(LPCOLESTR, ITypeLib**);
extern PFN_GetModuleFileNameW g_pfnGetModuleFileNameW;
extern PFN_LoadTypeLib g_pfnLoadTypeLib;

template <class T, const IID* piid, const GUID* plibid, WORD wMajor, WORD wMinor,
          class tihclass = CComTypeInfoHolder>
class IDispatchImpl : public T
{
public:
    STDMETHOD(GetTypeInfoCount)(UINT* pctinfo) override
    {
        if (pctinfo == nullptr) return E_POINTER;
        *pctinfo = 1;
        return S_OK;
    }
    STDMETHOD(GetTypeInfo)(UINT nIndex, LCID lcid, ITypeInfo** ppInfo) override
    {
        return _tih.GetTypeInfo(nIndex, lcid, ppInfo);
    }
    STDMETHOD(GetIDsOfNames)(REFIID riid, LPOLESTR* rgszNames, UINT cNames, LCID lcid, DISPID* rgDispId) override
    {
        return _tih.GetIDsOfNames(riid, rgszNames, cNames, lcid, rgDispId);
    }
    STDMETHOD(Invoke)(DISPID dispid, REFIID riid, LCID lcid, WORD wFlags, DISPPARAMS* pParams, VARIANT* pVarResult,
                      EXCEPINFO* pExcepInfo, UINT* puArgErr) override
    {
        return _tih.Invoke(static_cast<T*>(this), dispid, riid, lcid, wFlags, pParams, pVarResult, pExcepInfo,
                           puArgErr);
    }

    // Shared by every object of the class.
    static inline tihclass _tih{piid, plibid, wMajor, wMinor};
};

template <const IID* piid>
class ISupportErrorInfoImpl : public ISupportErrorInfo
{
public:
    STDMETHOD(InterfaceSupportsErrorInfo)(REFIID riid) override
    {
        return ::IsEqualGUID(riid, *piid) ? S_OK : S_FALSE;
    }
};

// ---- the concrete object -----------------------------------------------------------

// The instantiated class: the IUnknown of every face, the module lock count
// held for the object's life, and destruction through the last Release.
// Base provides _GetEntries() (its interface table) and FinalRelease().
template <class Base>
class CComObject final : public Base
{
public:
    // A new object with reference count 0, or E_OUTOFMEMORY.
    static HRESULT CreateInstance(CComObject** ppObject) noexcept
    {
        if (ppObject == nullptr) return E_POINTER;
        *ppObject = nullptr;
        CComObject* pObject = new (std::nothrow) CComObject();
        if (pObject == nullptr) return E_OUTOFMEMORY;
        // A final construction that AddRefs and Releases must not destroy the object.
        pObject->InternalAddRef();
        HRESULT hr = pObject->FinalConstruct();
        pObject->InternalRelease();
        if (FAILED(hr)) {
            delete pObject;
            return hr;
        }
        *ppObject = pObject;
        return S_OK;
    }

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        return Base::InternalQueryInterface(static_cast<Base*>(this), Base::_GetEntries(), riid, ppv);
    }
    STDMETHOD_(ULONG, AddRef)() override { return this->InternalAddRef(); }
    STDMETHOD_(ULONG, Release)() override
    {
        ULONG nRef = this->InternalRelease();
        if (nRef == 0) delete this;
        return nRef;
    }

    static void* operator new(size_t cb, const std::nothrow_t& tag) noexcept
    {
        return AllocationAllowed(cb) ? ::operator new(cb, tag) : nullptr;
    }
    static void operator delete(void* p) noexcept { ::operator delete(p); }
    static void operator delete(void* p, const std::nothrow_t&) noexcept { ::operator delete(p); }

private:
    CComObject() noexcept { ATL::_pAtlModule->LockModule(); }
    virtual ~CComObject()
    {
        // Any Release made while the members are torn down must not come
        // back here.
        this->m_dwRef = kDestructionRefCount;
        this->FinalRelease();
        ATL::_pAtlModule->UnlockModule();
    }

    static constexpr LONG kDestructionRefCount = -(LONG_MAX / 2);
    static_assert(static_cast<ULONG>(kDestructionRefCount) == 0xC0000001UL, "destruction count");
};
