// The COM identity of the server object (interface table, reference count,
// creation and destruction), its IDispatch served from the DLL's own type
// library with the name cache, ISupportErrorInfo and the error objects.
#include <gtest/gtest.h>

#include <windows.h>
#include <oleauto.h>

#include <atomic>
#include <string>
#include <thread>

#include "ReplServer_h.h"
#include "common/Raii.h"
#include "server/Module.h"
#include "server/ReplServerImpl.h"
#include "support/DispatchCall.h"
#include "support/TestClient.h"

namespace {

int __cdecl SucceedingExec(BSTR, BSTR, BSTR*)
{
    return 0;
}

CComTypeInfoHolder& Holder()
{
    return KxCIReplServerImpl::_tih;
}

// Drops the process-wide type information, as the unload would.
void ResetTypeInfoCache()
{
    CComTypeInfoHolder::ReleaseTypeInfoCache(reinterpret_cast<DWORD_PTR>(&Holder()));
}

LONG ModuleLockCount()
{
    return ATL::_pAtlModule->GetModuleLockCount();
}

// A server object owned by the test (one reference), not connected.
class CServerRef
{
public:
    CServerRef()
    {
        HRESULT hr = CreateServerObject(&m_pObject);
        if (FAILED(hr)) ThrowHResult(hr);
        m_pObject->AddRef();
    }
    CServerRef(const CServerRef&) = delete;
    CServerRef& operator=(const CServerRef&) = delete;
    ~CServerRef() { Reset(); }
    CReplServerObject* operator->() const noexcept { return m_pObject; }
    CReplServerObject* Get() const noexcept { return m_pObject; }
    IDispatch* Dispatch() const noexcept { return static_cast<IReplServer*>(m_pObject); }
    void Reset() noexcept
    {
        if (m_pObject != nullptr) std::exchange(m_pObject, nullptr)->Release();
    }

private:
    CReplServerObject* m_pObject = nullptr;
};

// The current count of an object, read through an AddRef/Release pair.
ULONG RefCountOf(IUnknown* pUnk)
{
    pUnk->AddRef();
    return pUnk->Release();
}

// An ITypeInfo that forwards every call to a real one and counts them, so a
// test can see whether the holder went into the type information at all.
class CCountingTypeInfo final : public ITypeInfo
{
public:
    explicit CCountingTypeInfo(ITypeInfo* pInner) : m_spInner(pInner) {}

    std::atomic<LONG> m_nCalls{0};
    std::atomic<LONG> m_nGetIDsOfNames{0};
    std::atomic<LONG> m_nInvoke{0};
    bool m_bFailDocumentation = false;

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        if (ppv == nullptr) return E_POINTER;
        *ppv = nullptr;
        if (!::IsEqualIID(riid, IID_IUnknown) && !::IsEqualIID(riid, IID_ITypeInfo)) return E_NOINTERFACE;
        *ppv = static_cast<ITypeInfo*>(this);
        AddRef();
        return S_OK;
    }
    STDMETHOD_(ULONG, AddRef)() override { return static_cast<ULONG>(++m_nRef); }
    STDMETHOD_(ULONG, Release)() override
    {
        LONG nRef = --m_nRef;
        if (nRef == 0) delete this;
        return static_cast<ULONG>(nRef);
    }
    STDMETHOD(GetTypeAttr)(TYPEATTR** pp) override { return Count(), m_spInner->GetTypeAttr(pp); }
    STDMETHOD(GetTypeComp)(ITypeComp** pp) override { return Count(), m_spInner->GetTypeComp(pp); }
    STDMETHOD(GetFuncDesc)(UINT n, FUNCDESC** pp) override { return Count(), m_spInner->GetFuncDesc(n, pp); }
    STDMETHOD(GetVarDesc)(UINT n, VARDESC** pp) override { return Count(), m_spInner->GetVarDesc(n, pp); }
    STDMETHOD(GetNames)(MEMBERID id, BSTR* rg, UINT c, UINT* pc) override
    {
        return Count(), m_spInner->GetNames(id, rg, c, pc);
    }
    STDMETHOD(GetRefTypeOfImplType)(UINT n, HREFTYPE* p) override
    {
        return Count(), m_spInner->GetRefTypeOfImplType(n, p);
    }
    STDMETHOD(GetImplTypeFlags)(UINT n, INT* p) override { return Count(), m_spInner->GetImplTypeFlags(n, p); }
    STDMETHOD(GetIDsOfNames)(LPOLESTR* rg, UINT c, MEMBERID* pid) override
    {
        ++m_nGetIDsOfNames;
        return Count(), m_spInner->GetIDsOfNames(rg, c, pid);
    }
    STDMETHOD(Invoke)(PVOID pv, MEMBERID id, WORD w, DISPPARAMS* pp, VARIANT* pr, EXCEPINFO* pe, UINT* pu) override
    {
        ++m_nInvoke;
        return Count(), m_spInner->Invoke(pv, id, w, pp, pr, pe, pu);
    }
    STDMETHOD(GetDocumentation)(MEMBERID id, BSTR* pName, BSTR* pDoc, DWORD* pCtx, BSTR* pFile) override
    {
        Count();
        if (m_bFailDocumentation) return TYPE_E_ELEMENTNOTFOUND;
        return m_spInner->GetDocumentation(id, pName, pDoc, pCtx, pFile);
    }
    STDMETHOD(GetDllEntry)(MEMBERID id, INVOKEKIND k, BSTR* p1, BSTR* p2, WORD* p3) override
    {
        return Count(), m_spInner->GetDllEntry(id, k, p1, p2, p3);
    }
    STDMETHOD(GetRefTypeInfo)(HREFTYPE h, ITypeInfo** pp) override { return Count(), m_spInner->GetRefTypeInfo(h, pp); }
    STDMETHOD(AddressOfMember)(MEMBERID id, INVOKEKIND k, PVOID* pp) override
    {
        return Count(), m_spInner->AddressOfMember(id, k, pp);
    }
    STDMETHOD(CreateInstance)(IUnknown* pOuter, REFIID riid, PVOID* pp) override
    {
        return Count(), m_spInner->CreateInstance(pOuter, riid, pp);
    }
    STDMETHOD(GetMops)(MEMBERID id, BSTR* p) override { return Count(), m_spInner->GetMops(id, p); }
    STDMETHOD(GetContainingTypeLib)(ITypeLib** pp, UINT* pn) override
    {
        return Count(), m_spInner->GetContainingTypeLib(pp, pn);
    }
    STDMETHOD_(void, ReleaseTypeAttr)(TYPEATTR* p) override { Count(), m_spInner->ReleaseTypeAttr(p); }
    STDMETHOD_(void, ReleaseFuncDesc)(FUNCDESC* p) override { Count(), m_spInner->ReleaseFuncDesc(p); }
    STDMETHOD_(void, ReleaseVarDesc)(VARDESC* p) override { Count(), m_spInner->ReleaseVarDesc(p); }

private:
    ~CCountingTypeInfo() = default;
    void Count() noexcept { ++m_nCalls; }
    CComPtr<ITypeInfo> m_spInner;
    std::atomic<LONG> m_nRef{1};
};

// The real type information of IReplServer, loaded through a server object.
CComPtr<ITypeInfo> RealTypeInfo()
{
    CServerRef server;
    CComPtr<ITypeInfo> spInfo;
    HRESULT hr = server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo);
    if (FAILED(hr)) ThrowHResult(hr);
    return spInfo;
}

// Puts a counting wrapper in place of the cached type information; the name
// cache is built anew through it at the next lookup. Undone on destruction.
class CCountingTypeInfoScope
{
public:
    CCountingTypeInfoScope()
    {
        CComPtr<ITypeInfo> spReal = RealTypeInfo();
        ResetTypeInfoCache();
        m_pCounting = new CCountingTypeInfo(spReal);
        m_pCounting->AddRef();  // the holder's reference
        Holder().m_pInfo.store(m_pCounting);
    }
    CCountingTypeInfoScope(const CCountingTypeInfoScope&) = delete;
    CCountingTypeInfoScope& operator=(const CCountingTypeInfoScope&) = delete;
    ~CCountingTypeInfoScope()
    {
        ResetTypeInfoCache();
        m_pCounting->Release();
    }
    CCountingTypeInfo* operator->() const noexcept { return m_pCounting; }

private:
    CCountingTypeInfo* m_pCounting = nullptr;
};

// Replaces the type library loaders for one scope.
class CLoaderScope
{
public:
    CLoaderScope(PFN_GetModuleFileNameW pfnPath, PFN_LoadTypeLib pfnLoad) noexcept
        : m_pfnPath(g_pfnGetModuleFileNameW), m_pfnLoad(g_pfnLoadTypeLib)
    {
        g_pfnGetModuleFileNameW = pfnPath;
        g_pfnLoadTypeLib = pfnLoad;
    }
    CLoaderScope(const CLoaderScope&) = delete;
    CLoaderScope& operator=(const CLoaderScope&) = delete;
    ~CLoaderScope()
    {
        g_pfnGetModuleFileNameW = m_pfnPath;
        g_pfnLoadTypeLib = m_pfnLoad;
    }

private:
    PFN_GetModuleFileNameW m_pfnPath;
    PFN_LoadTypeLib m_pfnLoad;
};

std::atomic<LONG> g_nLoadTypeLibCalls{0};

HRESULT WINAPI CountingLoadTypeLib(LPCOLESTR pszFile, ITypeLib** ppLib)
{
    ++g_nLoadTypeLibCalls;
    return ::LoadTypeLib(pszFile, ppLib);
}

HRESULT WINAPI FailingLoadTypeLib(LPCOLESTR, ITypeLib** ppLib)
{
    ++g_nLoadTypeLibCalls;
    *ppLib = nullptr;
    return TYPE_E_CANTLOADLIBRARY;
}

// A path of exactly the buffer's size: it did not fit.
DWORD WINAPI TruncatedModuleFileName(HMODULE, LPWSTR pszPath, DWORD cch)
{
    for (DWORD i = 0; i + 1 < cch; ++i) pszPath[i] = L'a';
    pszPath[cch - 1] = L'\0';
    return cch;
}

DWORD WINAPI FailingModuleFileName(HMODULE, LPWSTR, DWORD)
{
    ::SetLastError(ERROR_INVALID_HANDLE);
    return 0;
}

// Fails every allocation while it is installed.
class CNoMemoryScope
{
public:
    CNoMemoryScope() noexcept : m_pfnOld(g_pfnAllocationGate) { g_pfnAllocationGate = &Refuse; }
    CNoMemoryScope(const CNoMemoryScope&) = delete;
    CNoMemoryScope& operator=(const CNoMemoryScope&) = delete;
    ~CNoMemoryScope() { g_pfnAllocationGate = m_pfnOld; }

private:
    static bool Refuse(size_t) noexcept { return false; }
    PFN_AllocationGate m_pfnOld;
};

HRESULT GetIdOfName(IDispatch* pDispatch, const wchar_t* pszName, DISPID* pDispId)
{
    LPOLESTR rgszNames[] = {const_cast<LPOLESTR>(pszName)};
    return pDispatch->GetIDsOfNames(IID_NULL, rgszNames, 1, LOCALE_USER_DEFAULT, pDispId);
}

DispatchOutcome* InvokeQuit(IDispatch* pDispatch, DispatchOutcome& outcome)
{
    InvokeMethod(pDispatch, 3, {}, outcome);
    return &outcome;
}

}  // namespace

// ---- identity and reference counting ----------------------------------------------

TEST(ServerIdentity, UnknownDispatchAndReplServerAreOnePointer)
{
    CServerRef server;
    CComPtr<IUnknown> spUnk;
    CComPtr<IDispatch> spDispatch;
    CComPtr<IReplServer> spServer;
    ASSERT_EQ(S_OK, server->QueryInterface(IID_IUnknown, reinterpret_cast<void**>(&spUnk)));
    ASSERT_EQ(S_OK, server->QueryInterface(IID_IDispatch, reinterpret_cast<void**>(&spDispatch)));
    ASSERT_EQ(S_OK, server->QueryInterface(IID_IReplServer, reinterpret_cast<void**>(&spServer)));
    EXPECT_EQ(static_cast<void*>(spUnk.Get()), static_cast<void*>(spDispatch.Get()));
    EXPECT_EQ(static_cast<void*>(spUnk.Get()), static_cast<void*>(spServer.Get()));
    EXPECT_EQ(static_cast<void*>(spUnk.Get()), static_cast<void*>(server.Dispatch()));
}

TEST(ServerIdentity, SupportErrorInfoIsASecondFaceSharingTheCount)
{
    CServerRef server;
    CComPtr<ISupportErrorInfo> spSupport;
    ASSERT_EQ(S_OK, server->QueryInterface(IID_ISupportErrorInfo, reinterpret_cast<void**>(&spSupport)));
    EXPECT_NE(static_cast<void*>(spSupport.Get()), static_cast<void*>(server.Dispatch()));
    ULONG nBefore = RefCountOf(server.Dispatch());
    EXPECT_EQ(nBefore + 1, spSupport->AddRef());
    EXPECT_EQ(nBefore + 1, RefCountOf(server.Dispatch()));
    EXPECT_EQ(nBefore, spSupport->Release());
    // Back through the second face to the first.
    CComPtr<IReplServer> spServer;
    ASSERT_EQ(S_OK, spSupport->QueryInterface(IID_IReplServer, reinterpret_cast<void**>(&spServer)));
    EXPECT_EQ(static_cast<void*>(spServer.Get()), static_cast<void*>(server.Dispatch()));
}

TEST(ServerIdentity, OtherInterfacesAreRefusedWithANullPointer)
{
    CServerRef server;
    ULONG nBefore = RefCountOf(server.Dispatch());
    for (const IID* piid : {&IID_IReplClient, &IID_IClassFactory, &IID_IPersist, &IID_IMarshal, &IID_IErrorInfo}) {
        void* pv = reinterpret_cast<void*>(static_cast<uintptr_t>(0x1234));
        EXPECT_EQ(E_NOINTERFACE, server->QueryInterface(*piid, &pv));
        EXPECT_EQ(nullptr, pv);
    }
    EXPECT_EQ(E_POINTER, server->QueryInterface(IID_IDispatch, nullptr));
    EXPECT_EQ(nBefore, RefCountOf(server.Dispatch()));
}

TEST(ServerLifetime, NewObjectHasCountZeroAndHoldsTheModule)
{
    LONG nLocks = ModuleLockCount();
    CReplServerObject* pObject = nullptr;
    ASSERT_EQ(S_OK, CreateServerObject(&pObject));
    ASSERT_NE(nullptr, pObject);
    EXPECT_EQ(nLocks + 1, ModuleLockCount());
    EXPECT_EQ(1u, pObject->AddRef());
    EXPECT_EQ(2u, pObject->AddRef());
    EXPECT_EQ(1u, pObject->Release());
    EXPECT_EQ(0u, pObject->Release());  // destroyed
    EXPECT_EQ(nLocks, ModuleLockCount());
}

TEST(ServerLifetime, CreationRefusesANullOutPointer)
{
    LONG nLocks = ModuleLockCount();
    EXPECT_EQ(E_POINTER, CreateServerObject(nullptr));
    EXPECT_EQ(nLocks, ModuleLockCount());
}

TEST(ServerLifetime, AllocationFailureGivesOutOfMemoryAndNoLock)
{
    LONG nLocks = ModuleLockCount();
    CReplServerObject* pObject = reinterpret_cast<CReplServerObject*>(static_cast<uintptr_t>(0x1234));
    {
        CNoMemoryScope noMemory;
        EXPECT_EQ(E_OUTOFMEMORY, CreateServerObject(&pObject));
    }
    EXPECT_EQ(nullptr, pObject);
    EXPECT_EQ(nLocks, ModuleLockCount());
}

TEST(ServerLifetime, DestructionClearsTheCurrentServer)
{
    CServerRef server;
    g_pCurrentServer = server.Get();
    server.Reset();
    EXPECT_EQ(nullptr, g_pCurrentServer);
}

TEST(ServerLifetime, DestroyingAnOldObjectLeavesTheCurrentServerAlone)
{
    CServerRef current;
    CServerRef old;
    g_pCurrentServer = current.Get();
    old.Reset();
    EXPECT_EQ(current.Get(), g_pCurrentServer);
    g_pCurrentServer = nullptr;
}

namespace {
// A client whose last Release calls back into the server, as a client's
// object graph may do while the server is being destroyed.
class CCallbackOnReleaseClient final : public IDispatch
{
public:
    IUnknown* m_pServer = nullptr;
    ULONG m_nAddRefDuringRelease = 0;
    ULONG m_nReleaseDuringRelease = 0;
    bool m_bCalledBack = false;

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        if (ppv == nullptr) return E_POINTER;
        *ppv = nullptr;
        if (!::IsEqualIID(riid, IID_IUnknown) && !::IsEqualIID(riid, IID_IDispatch)) return E_NOINTERFACE;
        *ppv = static_cast<IDispatch*>(this);
        AddRef();
        return S_OK;
    }
    STDMETHOD_(ULONG, AddRef)() override { return ++m_nRef; }
    STDMETHOD_(ULONG, Release)() override
    {
        if (--m_nRef == 0 && m_pServer != nullptr) {
            m_bCalledBack = true;
            m_nAddRefDuringRelease = m_pServer->AddRef();
            m_nReleaseDuringRelease = m_pServer->Release();
        }
        return m_nRef;
    }
    STDMETHOD(GetTypeInfoCount)(UINT*) override { return E_NOTIMPL; }
    STDMETHOD(GetTypeInfo)(UINT, LCID, ITypeInfo**) override { return E_NOTIMPL; }
    STDMETHOD(GetIDsOfNames)(REFIID, LPOLESTR*, UINT, LCID, DISPID*) override { return E_NOTIMPL; }
    STDMETHOD(Invoke)(DISPID, REFIID, LCID, WORD, DISPPARAMS*, VARIANT*, EXCEPINFO*, UINT*) override
    {
        return E_FAIL;  // refuses Connect
    }

private:
    ULONG m_nRef = 1;
};
}  // namespace

TEST(ServerLifetime, AReleaseDuringDestructionDoesNotDestroyTwice)
{
    LONG nLocks = ModuleLockCount();
    CCallbackOnReleaseClient client;
    CReplServerObject* pObject = nullptr;
    ASSERT_EQ(S_OK, CreateServerObject(&pObject));
    pObject->AddRef();
    client.m_pServer = static_cast<IReplServer*>(pObject);
    // A refused Connect leaves the client stored until destruction.
    EXPECT_EQ(E_FAIL, pObject->Init(&client, nullptr, nullptr, SucceedingExec, nullptr));
    client.Release();  // the object now holds the client's last reference
    EXPECT_EQ(0u, pObject->Release());
    ASSERT_TRUE(client.m_bCalledBack);
    EXPECT_EQ(0xC0000002u, client.m_nAddRefDuringRelease);
    EXPECT_EQ(0xC0000001u, client.m_nReleaseDuringRelease);
    EXPECT_EQ(nLocks, ModuleLockCount());
}

// ---- type information ------------------------------------------------------------------

TEST(TypeInformation, CountIsOne)
{
    CServerRef server;
    UINT nCount = 0;
    EXPECT_EQ(S_OK, server->GetTypeInfoCount(&nCount));
    EXPECT_EQ(1u, nCount);
    EXPECT_EQ(E_POINTER, server->GetTypeInfoCount(nullptr));
}

TEST(TypeInformation, IndexZeroDescribesIReplServer)
{
    CServerRef server;
    CComPtr<ITypeInfo> spInfo;
    ASSERT_EQ(S_OK, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
    ASSERT_NE(nullptr, spInfo.Get());
    TYPEATTR* pAttr = nullptr;
    ASSERT_EQ(S_OK, spInfo->GetTypeAttr(&pAttr));
    EXPECT_TRUE(::IsEqualGUID(pAttr->guid, IID_IReplServer));
    spInfo->ReleaseTypeAttr(pAttr);
    EXPECT_EQ(E_POINTER, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, nullptr));
}

TEST(TypeInformation, IndexOneIsBadWhateverTheCacheHolds)
{
    CServerRef server;
    ResetTypeInfoCache();
    ITypeInfo* pInfo = reinterpret_cast<ITypeInfo*>(static_cast<uintptr_t>(0x1234));
    EXPECT_EQ(DISP_E_BADINDEX, server->GetTypeInfo(1, LOCALE_USER_DEFAULT, &pInfo));
    EXPECT_EQ(nullptr, Holder().m_pInfo.load());  // refused before any load
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Exec", &dispid));  // fills the cache
    EXPECT_EQ(DISP_E_BADINDEX, server->GetTypeInfo(1, LOCALE_USER_DEFAULT, &pInfo));
    EXPECT_EQ(DISP_E_BADINDEX, server->GetTypeInfo(1, LOCALE_USER_DEFAULT, nullptr));
}

TEST(NameCache, MethodNamesAreAnsweredWithoutTheTypeInformation)
{
    CServerRef server;
    CCountingTypeInfoScope counting;
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Quit", &dispid));  // builds the cache
    EXPECT_EQ(3, dispid);
    counting->m_nCalls = 0;
    const struct
    {
        const wchar_t* pszName;
        DISPID dispid;
    } rgCases[] = {{L"Exec", 1}, {L"ExecCom", 2}, {L"Quit", 3}};
    for (const auto& test : rgCases) {
        DISPID dispidFound = 0;
        EXPECT_EQ(S_OK, GetIdOfName(server.Dispatch(), test.pszName, &dispidFound)) << test.pszName;
        EXPECT_EQ(test.dispid, dispidFound) << test.pszName;
    }
    EXPECT_EQ(0, counting->m_nCalls.load());
}

TEST(NameCache, OtherCaseIsDecidedByTheTypeInformation)
{
    CServerRef server;
    CComPtr<ITypeInfo> spReal = RealTypeInfo();
    LPOLESTR rgszUpper[] = {const_cast<LPOLESTR>(L"EXEC")};
    DISPID dispidExpected = 0;
    HRESULT hrExpected = spReal->GetIDsOfNames(rgszUpper, 1, &dispidExpected);

    CCountingTypeInfoScope counting;
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Exec", &dispid));  // builds the cache
    counting->m_nGetIDsOfNames = 0;
    DISPID dispidFound = -7;
    EXPECT_EQ(hrExpected, GetIdOfName(server.Dispatch(), L"EXEC", &dispidFound));
    EXPECT_EQ(1, counting->m_nGetIDsOfNames.load());
    if (SUCCEEDED(hrExpected)) {
        EXPECT_EQ(dispidExpected, dispidFound);
    }
}

TEST(NameCache, UnknownNameIsRefusedByTheTypeInformation)
{
    CServerRef server;
    DISPID dispid = 0;
    EXPECT_EQ(DISP_E_UNKNOWNNAME, GetIdOfName(server.Dispatch(), L"Execute", &dispid));
    EXPECT_EQ(DISP_E_UNKNOWNNAME, GetIdOfName(server.Dispatch(), L"Exe", &dispid));
}

TEST(NameCache, MethodWithParameterNameResolvesBoth)
{
    CServerRef server;
    CCountingTypeInfoScope counting;
    LPOLESTR rgszNames[] = {const_cast<LPOLESTR>(L"Exec"), const_cast<LPOLESTR>(L"Argument")};
    DISPID rgDispId[2] = {0, 0};
    EXPECT_EQ(S_OK, server->GetIDsOfNames(IID_NULL, rgszNames, 2, LOCALE_USER_DEFAULT, rgDispId));
    EXPECT_EQ(1, rgDispId[0]);
    EXPECT_EQ(1, rgDispId[1]);  // the second declared parameter
    EXPECT_EQ(1, counting->m_nGetIDsOfNames.load());
}

TEST(NameCache, AnEntryWithoutANameNeverMatchesTheEmptyName)
{
    CServerRef server;
    CCountingTypeInfoScope counting;
    counting->m_bFailDocumentation = true;  // every entry stays {null, 0, -1}
    DISPID dispid = 0;
    EXPECT_EQ(DISP_E_UNKNOWNNAME, GetIdOfName(server.Dispatch(), L"", &dispid));
    ASSERT_NE(nullptr, Holder().m_pMap.load());
    EXPECT_EQ(1, counting->m_nGetIDsOfNames.load());
    // The names still resolve, through the type information.
    EXPECT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"ExecCom", &dispid));
    EXPECT_EQ(2, dispid);
}

TEST(NameCache, FilledCachesTakeNoLock)
{
    CServerRef server;
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Exec", &dispid));
    CHandle hDone(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    ASSERT_TRUE(hDone.IsValid());
    HRESULT hrLookup = E_UNEXPECTED;
    HRESULT hrInvoke = E_UNEXPECTED;
    DWORD dwWait = WAIT_FAILED;
    std::thread worker;
    {
        // Held by this thread while another one uses the filled caches.
        CCritSecLock lock(ATL::_pAtlModule->ModuleLock());
        worker = std::thread([&] {
            DISPID dispidWorker = 0;
            hrLookup = GetIdOfName(server.Dispatch(), L"ExecCom", &dispidWorker);
            DispatchOutcome outcome;
            InvokeMethod(server.Dispatch(), 3, {}, outcome);  // Quit of an unconnected object
            hrInvoke = outcome.hr;
            ::SetEvent(hDone.Get());
        });
        dwWait = ::WaitForSingleObject(hDone.Get(), 10000);
    }
    worker.join();
    EXPECT_EQ(WAIT_OBJECT_0, dwWait);
    EXPECT_EQ(S_OK, hrLookup);
    EXPECT_EQ(S_OK, hrInvoke);
}

TEST(TypeLibraryLoading, TwoObjectsLoadTheLibraryOnce)
{
    ResetTypeInfoCache();
    g_nLoadTypeLibCalls = 0;
    CLoaderScope loader(::GetModuleFileNameW, CountingLoadTypeLib);
    {
        CServerRef first;
        DISPID dispid = 0;
        EXPECT_EQ(S_OK, GetIdOfName(first.Dispatch(), L"Exec", &dispid));
        DispatchOutcome outcome;
        EXPECT_EQ(S_OK, InvokeQuit(first.Dispatch(), outcome)->hr);
    }
    {
        CServerRef second;
        CComPtr<ITypeInfo> spInfo;
        EXPECT_EQ(S_OK, second->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
        DISPID dispid = 0;
        EXPECT_EQ(S_OK, GetIdOfName(second.Dispatch(), L"ExecCom", &dispid));
        DispatchOutcome outcome;
        EXPECT_EQ(S_OK, InvokeQuit(second.Dispatch(), outcome)->hr);
    }
    EXPECT_EQ(1, g_nLoadTypeLibCalls.load());
}

TEST(TypeLibraryLoading, PathThatDoesNotFitFailsAndIsRetried)
{
    CServerRef server;
    ResetTypeInfoCache();
    for (PFN_GetModuleFileNameW pfnPath : {&TruncatedModuleFileName, &FailingModuleFileName}) {
        CLoaderScope loader(pfnPath, CountingLoadTypeLib);
        g_nLoadTypeLibCalls = 0;
        CComPtr<ITypeInfo> spInfo;
        EXPECT_EQ(E_FAIL, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
        EXPECT_EQ(nullptr, spInfo.Get());
        DISPID dispid = 0;
        EXPECT_EQ(E_FAIL, GetIdOfName(server.Dispatch(), L"Exec", &dispid));
        DispatchOutcome outcome;
        EXPECT_EQ(E_FAIL, InvokeQuit(server.Dispatch(), outcome)->hr);
        EXPECT_EQ(0, g_nLoadTypeLibCalls.load());  // never a truncated path
        EXPECT_EQ(nullptr, Holder().m_pInfo.load());
    }
    DISPID dispid = 0;
    EXPECT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Exec", &dispid));
    EXPECT_EQ(1, dispid);
}

TEST(TypeLibraryLoading, LoadFailureIsReturnedAndRetried)
{
    CServerRef server;
    ResetTypeInfoCache();
    {
        CLoaderScope loader(::GetModuleFileNameW, FailingLoadTypeLib);
        g_nLoadTypeLibCalls = 0;
        CComPtr<ITypeInfo> spInfo;
        EXPECT_EQ(TYPE_E_CANTLOADLIBRARY, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
        DISPID dispid = 0;
        EXPECT_EQ(TYPE_E_CANTLOADLIBRARY, GetIdOfName(server.Dispatch(), L"Exec", &dispid));
        DispatchOutcome outcome;
        EXPECT_EQ(TYPE_E_CANTLOADLIBRARY, InvokeQuit(server.Dispatch(), outcome)->hr);
        EXPECT_EQ(3, g_nLoadTypeLibCalls.load());
        EXPECT_EQ(nullptr, Holder().m_pInfo.load());
    }
    CComPtr<ITypeInfo> spInfo;
    EXPECT_EQ(S_OK, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
}

TEST(TypeLibraryLoading, NameCacheWithoutMemoryLeavesTheTypeInformationServing)
{
    CServerRef server;
    ResetTypeInfoCache();
    {
        CNoMemoryScope noMemory;
        CComPtr<ITypeInfo> spInfo;
        EXPECT_EQ(S_OK, server->GetTypeInfo(0, LOCALE_USER_DEFAULT, &spInfo));
        EXPECT_NE(nullptr, spInfo.Get());
        EXPECT_EQ(nullptr, Holder().m_pMap.load());
        DISPID dispid = 0;
        EXPECT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"ExecCom", &dispid));
        EXPECT_EQ(2, dispid);
        EXPECT_EQ(E_OUTOFMEMORY, Holder().LoadTypeInfo(LOCALE_USER_DEFAULT));
    }
    DISPID dispid = 0;
    EXPECT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Quit", &dispid));
    EXPECT_NE(nullptr, Holder().m_pMap.load());  // built at the next call
}

TEST(TypeLibraryLoading, ReleaseDropsBothCaches)
{
    CServerRef server;
    DISPID dispid = 0;
    ASSERT_EQ(S_OK, GetIdOfName(server.Dispatch(), L"Exec", &dispid));
    ASSERT_NE(nullptr, Holder().m_pInfo.load());
    ASSERT_NE(nullptr, Holder().m_pMap.load());
    ResetTypeInfoCache();
    EXPECT_EQ(nullptr, Holder().m_pInfo.load());
    EXPECT_EQ(nullptr, Holder().m_pMap.load());
    ResetTypeInfoCache();  // a second release finds nothing to drop
}

// ---- error information -------------------------------------------------------------------

TEST(ErrorInfo, OnlyIReplServerSupportsIt)
{
    CServerRef server;
    CComPtr<ISupportErrorInfo> spSupport;
    ASSERT_EQ(S_OK, server->QueryInterface(IID_ISupportErrorInfo, reinterpret_cast<void**>(&spSupport)));
    EXPECT_EQ(S_OK, spSupport->InterfaceSupportsErrorInfo(IID_IReplServer));
    EXPECT_EQ(S_FALSE, spSupport->InterfaceSupportsErrorInfo(IID_IDispatch));
    EXPECT_EQ(S_FALSE, spSupport->InterfaceSupportsErrorInfo(IID_IUnknown));
    EXPECT_EQ(S_FALSE, spSupport->InterfaceSupportsErrorInfo(IID_IReplClient));
}

TEST(ErrorInfo, ReportInstallsTheErrorObject)
{
    ::SetErrorInfo(0, nullptr);
    EXPECT_EQ(DISP_E_EXCEPTION, ReportErrorInfo(CLSID_ReplServer, L"it broke", IID_IReplServer, DISP_E_EXCEPTION));
    CComPtr<IErrorInfo> spInfo;
    ASSERT_EQ(S_OK, ::GetErrorInfo(0, &spInfo));
    CComBSTR bstrDescription;
    CComBSTR bstrSource;
    CComBSTR bstrHelpFile;
    GUID guid = GUID_NULL;
    DWORD dwHelpContext = 99;
    EXPECT_EQ(S_OK, spInfo->GetDescription(&bstrDescription));
    EXPECT_STREQ(L"it broke", bstrDescription.Get());
    EXPECT_EQ(S_OK, spInfo->GetGUID(&guid));
    EXPECT_TRUE(::IsEqualGUID(guid, IID_IReplServer));
    spInfo->GetSource(&bstrSource);
    EXPECT_EQ(0u, bstrSource.Length());  // nothing registers a ProgID
    spInfo->GetHelpFile(&bstrHelpFile);
    EXPECT_EQ(0u, bstrHelpFile.Length());
    spInfo->GetHelpContext(&dwHelpContext);
    EXPECT_EQ(0u, dwHelpContext);
}

TEST(ErrorInfo, ReportResultIsTheGivenHResultOrDispException)
{
    EXPECT_EQ(DISP_E_EXCEPTION, ReportErrorInfo(CLSID_ReplServer, L"text", IID_IReplServer, S_OK));
    EXPECT_EQ(E_ABORT, ReportErrorInfo(CLSID_ReplServer, L"text", IID_IReplServer, E_ABORT));
    EXPECT_EQ(S_FALSE, ReportErrorInfo(CLSID_ReplServer, L"text", IID_IReplServer, S_FALSE));
    ::SetErrorInfo(0, nullptr);
}
