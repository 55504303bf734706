// The module object and its records in a program built from the core
// library: what static construction left behind, the object map, the lock
// count and the module lock, the termination callbacks, and the life of a
// module object from construction to destruction on threads of each kind.
#include <gtest/gtest.h>

#include <algorithm>
#include <functional>
#include <memory>
#include <mutex>
#include <new>
#include <numeric>
#include <string>
#include <utility>
#include <vector>

#include "common/Raii.h"
#include "server/Module.h"

namespace {

bool g_bFailNothrowNew = false;  // makes the module's record allocation fail

}  // namespace

// The module allocates its termination records with nothrow new; this
// replacement lets a test refuse that allocation.
void* operator new(std::size_t cb, const std::nothrow_t&) noexcept
{
    if (g_bFailNothrowNew) return nullptr;
    try {
        return ::operator new(cb);
    } catch (...) {
        return nullptr;
    }
}

namespace {

constexpr DWORD kThreadTimeoutMs = 30000;

class CFailNothrowNew
{
public:
    CFailNothrowNew() { g_bFailNothrowNew = true; }
    ~CFailNothrowNew() { g_bFailNothrowNew = false; }
    CFailNothrowNew(const CFailNothrowNew&) = delete;
    CFailNothrowNew& operator=(const CFailNothrowNew&) = delete;
};

// The calling thread's apartment as a word, so that failures read well.
std::string Apartment()
{
    APTTYPE type = APTTYPE_CURRENT;
    APTTYPEQUALIFIER qualifier = APTTYPEQUALIFIER_NONE;
    HRESULT hr = ::CoGetApartmentType(&type, &qualifier);
    if (hr == CO_E_NOTINITIALIZED) return "none";
    if (FAILED(hr)) return "error " + std::to_string(hr);
    switch (type) {
    case APTTYPE_STA:
    case APTTYPE_MAINSTA:
        return "STA";
    case APTTYPE_MTA:
        return qualifier == APTTYPEQUALIFIER_IMPLICIT_MTA ? "implicit MTA" : "MTA";
    default:
        return "other " + std::to_string(type);
    }
}

DWORD WINAPI RunFunction(LPVOID pv)
{
    (*static_cast<std::function<void()>*>(pv))();
    return 0;
}

// Runs fn on nThreads new threads (which start without COM) and waits for
// all of them. A hang ends the whole program: fn refers to the caller's frame.
void OnNewThreads(int nThreads, std::function<void()> fn)
{
    std::vector<CHandle> vecThreads;
    for (int i = 0; i < nThreads; ++i) {
        vecThreads.emplace_back(::CreateThread(nullptr, 0, RunFunction, &fn, 0, nullptr));
        ASSERT_TRUE(vecThreads.back().IsValid());
    }
    for (CHandle& hThread : vecThreads) {
        if (::WaitForSingleObject(hThread.Get(), kThreadTimeoutMs) != WAIT_OBJECT_0) {
            ADD_FAILURE() << "test thread did not finish within " << kThreadTimeoutMs << " ms";
            ::ExitProcess(3);
        }
    }
}

void OnNewThread(std::function<void()> fn)
{
    OnNewThreads(1, std::move(fn));
}

// A second module object for one scope, made and destroyed as the loader
// makes and destroys the DLL's; afterwards the program's own module object
// is the process's module object again.
class CScopedModule
{
public:
    CScopedModule() : m_pPrevious(ATL::_pAtlModule), m_spModule(new CReplServerModule) {}
    ~CScopedModule() { Destroy(); }
    CScopedModule(const CScopedModule&) = delete;
    CScopedModule& operator=(const CScopedModule&) = delete;

    CReplServerModule* operator->() const { return m_spModule.get(); }
    CReplServerModule* Get() const { return m_spModule.get(); }
    // Returns the process's module object as the destruction left it.
    ATL::CAtlModule* Destroy()
    {
        m_spModule.reset();
        ATL::CAtlModule* pAfter = ATL::_pAtlModule;
        ATL::_pAtlModule = m_pPrevious;
        return pAfter;
    }

private:
    ATL::CAtlModule* m_pPrevious;
    std::unique_ptr<CReplServerModule> m_spModule;
};

// What each termination callback saw when it ran.
struct CallLog
{
    std::mutex mutex;
    std::vector<int> vecIds;
    std::vector<std::string> vecApartments;
};

struct CallbackArg
{
    CallLog* pLog;
    int nId;
};

void __stdcall RecordCall(DWORD_PTR dw)
{
    const CallbackArg* pArg = reinterpret_cast<const CallbackArg*>(dw);
    std::lock_guard<std::mutex> lock(pArg->pLog->mutex);
    pArg->pLog->vecIds.push_back(pArg->nId);
    pArg->pLog->vecApartments.push_back(Apartment());
}

DWORD_PTR ArgOf(const CallbackArg& arg)
{
    return reinterpret_cast<DWORD_PTR>(&arg);
}

// ---- what static construction left behind ----------------------------------

// Globals of another translation unit, one without a priority and one with
// the output queue's: both must find the module object and its records
// already made (and are therefore destroyed before them).
struct CConstructionProbe
{
    CConstructionProbe()
        : bModuleReady(ATL::_pAtlModule == &_AtlModule && _AtlModule.IsInitialized() &&
                       ATL::_AtlComModule.cbSize != 0 && ATL::_AtlBaseModule.cbSize != 0)
    {
    }
    bool bModuleReady;
};
CConstructionProbe g_probeWithoutPriority;
CConstructionProbe g_probeAsOutputQueue REPL_INIT_PRIORITY(REPL_INIT_OUTPUT_QUEUE);

TEST(ModuleGlobals, LaterGlobalsFindTheModuleAlreadyMade)
{
    EXPECT_TRUE(g_probeWithoutPriority.bModuleReady);
    EXPECT_TRUE(g_probeAsOutputQueue.bModuleReady);
}

TEST(ModuleGlobals, ModuleObjectAndRecordsAreConstructedAndInitialized)
{
    HINSTANCE hOwn = ::GetModuleHandleW(nullptr);
    EXPECT_FALSE(ATL::g_bAtlInitFailed);
    EXPECT_EQ(ATL::_pAtlModule, static_cast<ATL::CAtlModule*>(&_AtlModule));
    EXPECT_TRUE(_AtlModule.IsInitialized());
    EXPECT_TRUE(::IsEqualGUID(_AtlModule.LibId(), LIBID_ReplServerLib));
    EXPECT_NE(ATL::_AtlComModule.cbSize, 0u);
    EXPECT_TRUE(ATL::_AtlComModule.m_csObjMap.IsInitialized());
    EXPECT_EQ(ATL::_AtlComModule.m_hInstTypeLib, hOwn);
    EXPECT_NE(ATL::_AtlBaseModule.cbSize, 0u);
    EXPECT_TRUE(ATL::_AtlBaseModule.m_csResource.IsInitialized());
    EXPECT_EQ(ATL::_AtlBaseModule.GetModuleInstance(), hOwn);
    EXPECT_EQ(ATL::_AtlBaseModule.GetResourceInstance(), hOwn);
}

TEST(ModuleGlobals, LoadingThreadIsInSingleThreadedApartment)
{
    EXPECT_EQ(Apartment(), "STA");
}

// The base record's module handle is where the type library is read from.
TEST(ModuleGlobals, ModuleInstanceFileCarriesTheLibraryOfTheModulesId)
{
    WCHAR szPath[MAX_PATH];
    DWORD cch = ::GetModuleFileNameW(ATL::_AtlBaseModule.GetModuleInstance(), szPath, MAX_PATH);
    ASSERT_GT(cch, 0u);
    ASSERT_LT(cch, static_cast<DWORD>(MAX_PATH));
    CComPtr<ITypeLib> spLib;
    ASSERT_EQ(::LoadTypeLibEx(szPath, REGKIND_NONE, &spLib), S_OK);
    TLIBATTR* pAttr = nullptr;
    ASSERT_EQ(spLib->GetLibAttr(&pAttr), S_OK);
    EXPECT_TRUE(::IsEqualGUID(pAttr->guid, _AtlModule.LibId()));
    spLib->ReleaseTLibAttr(pAttr);
}

// ---- object map -------------------------------------------------------------

TEST(ObjectMap, KnowsReplServerWithoutMakingItCreatable)
{
    const ATL::_ATL_COM_MODULE70& record = ATL::_AtlComModule;
    ASSERT_EQ(record.m_pObjMapLast - record.m_pObjMapFirst, 1);
    const ATL::_ATL_OBJMAP_ENTRY& entry = *record.m_pObjMapFirst;
    ASSERT_NE(entry.pclsid, nullptr);
    EXPECT_TRUE(::IsEqualGUID(*entry.pclsid, CLSID_ReplServer));
    ASSERT_NE(entry.pfnUpdateRegistry, nullptr);
    EXPECT_EQ(entry.pfnUpdateRegistry(TRUE), S_OK);
    EXPECT_EQ(entry.pfnUpdateRegistry(FALSE), S_OK);
    EXPECT_EQ(entry.pfnGetClassObject, nullptr);
    EXPECT_EQ(entry.pfnCreateInstance, nullptr);
    EXPECT_EQ(entry.pCF, nullptr);
    EXPECT_EQ(entry.dwRegister, 0u);
    EXPECT_EQ(entry.pfnGetObjectDescription, nullptr);
    ASSERT_NE(entry.pfnGetCategoryMap, nullptr);
    EXPECT_EQ(entry.pfnGetCategoryMap(), nullptr);
    ASSERT_NE(entry.pfnObjectMain, nullptr);
    entry.pfnObjectMain(true);
    entry.pfnObjectMain(false);
}

// ---- lock count -------------------------------------------------------------

TEST(ModuleLockCount, LockAndUnlockReturnTheNewCount)
{
    LONG nStart = _AtlModule.GetModuleLockCount();
    EXPECT_EQ(_AtlModule.LockModule(), nStart + 1);
    EXPECT_EQ(_AtlModule.LockModule(), nStart + 2);
    EXPECT_EQ(_AtlModule.GetModuleLockCount(), nStart + 2);
    EXPECT_EQ(_AtlModule.UnlockModule(), nStart + 1);
    EXPECT_EQ(_AtlModule.UnlockModule(), nStart);
    EXPECT_EQ(_AtlModule.GetModuleLockCount(), nStart);
}

// Every new count that the threads see is distinct: no change was lost or
// seen twice, which only atomic steps guarantee.
TEST(ModuleLockCount, ChangesFromManyThreadsAreAtomic)
{
    constexpr int kThreads = 8;
    constexpr int kSteps = 20000;
    LONG nStart = _AtlModule.GetModuleLockCount();
    std::mutex mutex;
    std::vector<LONG> vecLocked, vecUnlocked;
    auto fnRun = [&](bool bLock, std::vector<LONG>& vecAll) {
        OnNewThreads(kThreads, [&] {
            std::vector<LONG> vecMine;
            for (int i = 0; i < kSteps; ++i) {
                vecMine.push_back(bLock ? _AtlModule.LockModule() : _AtlModule.UnlockModule());
            }
            std::lock_guard<std::mutex> lock(mutex);
            vecAll.insert(vecAll.end(), vecMine.begin(), vecMine.end());
        });
        std::sort(vecAll.begin(), vecAll.end());
    };

    fnRun(true, vecLocked);
    std::vector<LONG> vecExpected(kThreads * kSteps);
    std::iota(vecExpected.begin(), vecExpected.end(), nStart + 1);
    EXPECT_TRUE(vecLocked == vecExpected) << "lock results are not exactly start+1 .. start+N";
    EXPECT_EQ(_AtlModule.GetModuleLockCount(), nStart + kThreads * kSteps);

    fnRun(false, vecUnlocked);
    std::iota(vecExpected.begin(), vecExpected.end(), nStart);
    EXPECT_TRUE(vecUnlocked == vecExpected) << "unlock results are not exactly start .. start+N-1";
    EXPECT_EQ(_AtlModule.GetModuleLockCount(), nStart);
}

// ---- module lock ------------------------------------------------------------

TEST(ModuleLock, IsReentrantAndExcludesOtherThreads)
{
    bool bOtherGotItWhileHeld = true;
    bool bOtherGotItAfter = false;
    auto fnTryFromOtherThread = [](bool& bGot) {
        OnNewThread([&] {
            bGot = ::TryEnterCriticalSection(_AtlModule.ModuleLock()) != FALSE;
            if (bGot) ::LeaveCriticalSection(_AtlModule.ModuleLock());
        });
    };
    {
        CCritSecLock outer(_AtlModule.ModuleLock());
        CCritSecLock inner(_AtlModule.ModuleLock());
        fnTryFromOtherThread(bOtherGotItWhileHeld);
    }
    fnTryFromOtherThread(bOtherGotItAfter);
    EXPECT_FALSE(bOtherGotItWhileHeld);
    EXPECT_TRUE(bOtherGotItAfter);
}

// ---- termination callbacks ---------------------------------------------------

// The unload as the loader runs it, on a thread that had no COM before the
// module object was made: CoUninitialize comes first, so every callback
// runs with COM already gone, newest registration first.
TEST(TermCallbacks, RunNewestFirstAfterTheModuleLeftCom)
{
    CallLog log;
    CallbackArg rgArgs[] = {{&log, 1}, {&log, 2}, {&log, 3}};
    std::string strBefore, strWithModule, strAfter;
    ATL::CAtlModule* pAfterDestruction = &_AtlModule;
    OnNewThread([&] {
        strBefore = Apartment();
        CScopedModule module;
        strWithModule = Apartment();
        for (const CallbackArg& arg : rgArgs) EXPECT_EQ(module->AddTermCallback(RecordCall, ArgOf(arg)), S_OK);
        EXPECT_TRUE(log.vecIds.empty());
        pAfterDestruction = module.Destroy();
        strAfter = Apartment();
    });
    EXPECT_EQ(strBefore, "none");
    EXPECT_EQ(strWithModule, "STA");
    EXPECT_EQ(log.vecIds, (std::vector<int>{3, 2, 1}));
    EXPECT_EQ(log.vecApartments, (std::vector<std::string>{"none", "none", "none"}));
    EXPECT_EQ(strAfter, "none");
    EXPECT_EQ(pAfterDestruction, nullptr) << "a destroyed module must not stay the process's module object";
    EXPECT_EQ(ATL::_pAtlModule, static_cast<ATL::CAtlModule*>(&_AtlModule));
}

TEST(TermCallbacks, RunOnceAndEmptyTheList)
{
    CallLog log;
    CallbackArg rgArgs[] = {{&log, 1}, {&log, 2}};
    CScopedModule module;
    for (const CallbackArg& arg : rgArgs) ASSERT_EQ(module->AddTermCallback(RecordCall, ArgOf(arg)), S_OK);
    module->RunTermCallbacks();
    EXPECT_EQ(log.vecIds, (std::vector<int>{2, 1}));
    EXPECT_EQ(module->m_pTermFuncs, nullptr);
    module->RunTermCallbacks();
    module.Destroy();
    EXPECT_EQ(log.vecIds, (std::vector<int>{2, 1})) << "a callback ran twice";
}

// The type-information holder registers while it holds the module lock.
TEST(TermCallbacks, RegisterWhileHoldingTheModuleLock)
{
    CallLog log;
    CallbackArg arg{&log, 7};
    HRESULT hr = E_FAIL;
    OnNewThread([&] {
        CScopedModule module;
        {
            CCritSecLock lock(module->ModuleLock());
            hr = module->AddTermCallback(RecordCall, ArgOf(arg));
        }
        module.Destroy();
    });
    EXPECT_EQ(hr, S_OK);
    EXPECT_EQ(log.vecIds, std::vector<int>{7});
}

TEST(TermCallbacks, FailedAllocationReportsOutOfMemoryAndLeavesTheListAlone)
{
    CallLog log;
    CallbackArg rgArgs[] = {{&log, 1}, {&log, 2}};
    CScopedModule module;
    ASSERT_EQ(module->AddTermCallback(RecordCall, ArgOf(rgArgs[0])), S_OK);
    ATL::_ATL_TERMFUNC_ELEM* pHead = module->m_pTermFuncs;
    HRESULT hr = S_OK;
    {
        CFailNothrowNew failNew;
        hr = module->AddTermCallback(RecordCall, ArgOf(rgArgs[1]));
    }
    EXPECT_EQ(hr, E_OUTOFMEMORY);
    EXPECT_EQ(module->m_pTermFuncs, pHead);
    module.Destroy();
    EXPECT_EQ(log.vecIds, std::vector<int>{1});
}

TEST(TermCallbacks, RegistrationsFromManyThreadsAllRunOnce)
{
    constexpr int kThreads = 8;
    constexpr int kPerThread = 200;
    CallLog log;
    std::vector<CallbackArg> vecArgs;
    for (int i = 0; i < kThreads * kPerThread; ++i) vecArgs.push_back({&log, i});
    LONG nNext = -1;
    CScopedModule module;
    OnNewThreads(kThreads, [&] {
        for (int i = 0; i < kPerThread; ++i) {
            LONG nIndex = ::InterlockedIncrement(&nNext);
            EXPECT_EQ(module->AddTermCallback(RecordCall, ArgOf(vecArgs[nIndex])), S_OK);
        }
    });
    module.Destroy();
    std::vector<int> vecIds = log.vecIds;
    std::sort(vecIds.begin(), vecIds.end());
    std::vector<int> vecExpected(kThreads * kPerThread);
    std::iota(vecExpected.begin(), vecExpected.end(), 0);
    EXPECT_TRUE(vecIds == vecExpected) << "ran " << vecIds.size() << " callbacks";
}

// ---- a module object's COM initialization ------------------------------------

// The module gives back exactly the initialization it took.
TEST(ModuleLife, ThreadInSingleThreadedApartmentStaysInItAfterTheModule)
{
    HRESULT hrOwn = E_FAIL;
    std::string strAfterModule, strAfterOwn;
    OnNewThread([&] {
        hrOwn = ::CoInitialize(nullptr);
        CScopedModule module;
        module.Destroy();
        strAfterModule = Apartment();
        ::CoUninitialize();
        strAfterOwn = Apartment();
    });
    EXPECT_EQ(hrOwn, S_OK);
    EXPECT_EQ(strAfterModule, "STA");
    EXPECT_EQ(strAfterOwn, "none");
}

// CoInitialize fails there; the module object is made all the same and
// must not end that thread's own initialization.
TEST(ModuleLife, ThreadInMultithreadedApartmentKeepsIt)
{
    HRESULT hrOwn = E_FAIL;
    bool bInitialized = false;
    std::string strWithModule, strAfterModule;
    OnNewThread([&] {
        hrOwn = ::CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        CScopedModule module;
        bInitialized = module->IsInitialized();
        strWithModule = Apartment();
        module.Destroy();
        strAfterModule = Apartment();
        ::CoUninitialize();
    });
    EXPECT_EQ(hrOwn, S_OK);
    EXPECT_TRUE(bInitialized);
    EXPECT_EQ(strWithModule, "MTA");
    EXPECT_EQ(strAfterModule, "MTA");
}

// ---- the other operations of the module object --------------------------------

TEST(ModuleServices, GlobalInterfaceTableIsTheProcesssOne)
{
    CComPtr<IGlobalInterfaceTable> spFirst, spSecond;
    ASSERT_EQ(_AtlModule.GetGlobalInterfaceTable(&spFirst), S_OK);
    ASSERT_EQ(_AtlModule.GetGlobalInterfaceTable(&spSecond), S_OK);
    EXPECT_NE(spFirst.Get(), nullptr);
    EXPECT_EQ(spFirst.Get(), spSecond.Get());
    EXPECT_EQ(_AtlModule.GetGlobalInterfaceTable(nullptr), E_POINTER);
}

// A registrar that records the replacements it is given.
class CRecordingRegistrar : public ATL::IRegistrarBase
{
public:
    HRESULT STDMETHODCALLTYPE QueryInterface(REFIID, void** ppv) override
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    ULONG STDMETHODCALLTYPE AddRef() override { return 2; }
    ULONG STDMETHODCALLTYPE Release() override { return 1; }
    HRESULT STDMETHODCALLTYPE AddReplacement(LPCOLESTR pszKey, LPCOLESTR pszItem) override
    {
        m_vecPairs.emplace_back(pszKey, pszItem);
        return S_OK;
    }
    HRESULT STDMETHODCALLTYPE ClearReplacements() override
    {
        m_vecPairs.clear();
        return S_OK;
    }
    std::vector<std::pair<std::wstring, std::wstring>> m_vecPairs;
};

TEST(ModuleServices, RegistrarGetsTheEmptyAppId)
{
    CRecordingRegistrar registrar;
    EXPECT_EQ(_AtlModule.AddRegistrarReplacements(&registrar), S_OK);
    EXPECT_EQ(registrar.m_vecPairs, (std::vector<std::pair<std::wstring, std::wstring>>{{L"APPID", L""}}));
    EXPECT_EQ(_AtlModule.AddRegistrarReplacements(nullptr), E_POINTER);
}

}  // namespace
