// Loading and unloading the built DLL as a host process does: the loading
// thread's COM apartment before, during and after, and the refused load of
// builds whose module locks cannot be initialized.
#include <gtest/gtest.h>

#include <functional>
#include <string>

#include "common/Raii.h"

namespace {

constexpr DWORD kThreadTimeoutMs = 30000;

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

std::wstring BinaryPath(const wchar_t* pszName)
{
    WCHAR szPath[MAX_PATH];
    DWORD cch = ::GetModuleFileNameW(nullptr, szPath, MAX_PATH);
    std::wstring strPath(szPath, cch);
    return strPath.substr(0, strPath.find_last_of(L"\\/") + 1) + pszName;
}

// A library loaded for code, freed at the end of its scope unless freed before.
class CLibrary
{
public:
    explicit CLibrary(const std::wstring& strPath) noexcept
        : m_h(::LoadLibraryW(strPath.c_str())), m_dwError(m_h ? 0 : ::GetLastError())
    {
    }
    ~CLibrary() { Free(); }
    CLibrary(const CLibrary&) = delete;
    CLibrary& operator=(const CLibrary&) = delete;
    HMODULE Get() const noexcept { return m_h; }
    DWORD LoadError() const noexcept { return m_dwError; }
    bool Free() noexcept
    {
        HMODULE h = m_h;
        m_h = nullptr;
        return h == nullptr || ::FreeLibrary(h) != FALSE;
    }

private:
    HMODULE m_h;
    DWORD m_dwError;
};

DWORD WINAPI RunFunction(LPVOID pv)
{
    (*static_cast<std::function<void()>*>(pv))();
    return 0;
}

// Runs fn on a new thread, which starts without COM, and waits for it. A
// thread that hangs ends the whole program: fn refers to the caller's frame.
void OnNewThread(std::function<void()> fn)
{
    CHandle hThread(::CreateThread(nullptr, 0, RunFunction, &fn, 0, nullptr));
    ASSERT_TRUE(hThread.IsValid());
    if (::WaitForSingleObject(hThread.Get(), kThreadTimeoutMs) != WAIT_OBJECT_0) {
        ADD_FAILURE() << "test thread did not finish within " << kThreadTimeoutMs << " ms";
        ::ExitProcess(3);
    }
}

struct LoadObservation
{
    std::string strBefore;
    bool bLoaded = false;
    DWORD dwLoadError = 0;
    std::string strLoaded;
    bool bFreed = false;
    std::string strAfter;
    bool bStillMapped = false;
};

// Loads and frees the DLL on a new thread; prepare and finish set up and
// take down the thread's own COM initialization around it.
LoadObservation LoadAndUnload(const wchar_t* pszDll, std::function<void()> fnPrepare = [] {},
                              std::function<void()> fnFinish = [] {})
{
    LoadObservation obs;
    OnNewThread([&] {
        fnPrepare();
        obs.strBefore = Apartment();
        CLibrary library(BinaryPath(pszDll));
        obs.bLoaded = library.Get() != nullptr;
        obs.dwLoadError = library.LoadError();
        obs.strLoaded = Apartment();
        obs.bFreed = library.Free();
        obs.strAfter = Apartment();
        obs.bStillMapped = ::GetModuleHandleW(pszDll) != nullptr;
        fnFinish();
    });
    return obs;
}

TEST(DllLoad, LoadingThreadWithoutComEntersSingleThreadedApartmentUntilUnload)
{
    LoadObservation obs = LoadAndUnload(L"ReplServer.dll");
    EXPECT_EQ(obs.strBefore, "none");
    ASSERT_TRUE(obs.bLoaded) << "error " << obs.dwLoadError;
    EXPECT_EQ(obs.strLoaded, "STA");
    EXPECT_TRUE(obs.bFreed);
    EXPECT_FALSE(obs.bStillMapped);
    EXPECT_EQ(obs.strAfter, "none") << "the unload must leave COM again";
}

// The thread's own initialization survives the unload: the DLL gives back
// exactly the one it took.
TEST(DllLoad, UnloadLeavesTheThreadsOwnApartmentInPlace)
{
    HRESULT hrOwn = E_FAIL;
    std::string strAfterOwnUninit;
    LoadObservation obs = LoadAndUnload(
        L"ReplServer.dll", [&] { hrOwn = ::CoInitialize(nullptr); },
        [&] {
            ::CoUninitialize();
            strAfterOwnUninit = Apartment();
        });
    EXPECT_EQ(hrOwn, S_OK);
    ASSERT_TRUE(obs.bLoaded) << "error " << obs.dwLoadError;
    EXPECT_EQ(obs.strLoaded, "STA");
    EXPECT_EQ(obs.strAfter, "STA");
    EXPECT_EQ(strAfterOwnUninit, "none");
}

// CoInitialize fails on a thread of the multithreaded apartment; the DLL
// loads all the same and must not take that thread out of its apartment.
TEST(DllLoad, ThreadInMultithreadedApartmentLoadsAndKeepsItsApartment)
{
    HRESULT hrOwn = E_FAIL;
    LoadObservation obs = LoadAndUnload(
        L"ReplServer.dll", [&] { hrOwn = ::CoInitializeEx(nullptr, COINIT_MULTITHREADED); },
        [] { ::CoUninitialize(); });
    EXPECT_EQ(hrOwn, S_OK);
    EXPECT_EQ(obs.strBefore, "MTA");
    ASSERT_TRUE(obs.bLoaded) << "error " << obs.dwLoadError;
    EXPECT_EQ(obs.strLoaded, "MTA");
    EXPECT_EQ(obs.strAfter, "MTA");
}

// Builds of the module alone, from the DLL's own sources; all but the first
// fail to initialize one of the module's three locks.
TEST(ModuleFrame, LoadsWhenEveryLockInitializes)
{
    LoadObservation obs = LoadAndUnload(L"ReplModuleFrame.dll");
    ASSERT_TRUE(obs.bLoaded) << "error " << obs.dwLoadError;
    EXPECT_EQ(obs.strLoaded, "STA");
    EXPECT_EQ(obs.strAfter, "none");
}

class ModuleLockFailure : public ::testing::TestWithParam<const wchar_t*>
{
};

TEST_P(ModuleLockFailure, RefusesTheLoadAndLeavesNoApartmentBehind)
{
    LoadObservation obs = LoadAndUnload(GetParam());
    EXPECT_EQ(obs.strBefore, "none");
    EXPECT_FALSE(obs.bLoaded);
    EXPECT_EQ(obs.dwLoadError, static_cast<DWORD>(ERROR_DLL_INIT_FAILED));
    EXPECT_FALSE(obs.bStillMapped);
    EXPECT_EQ(obs.strAfter, "none");
}

INSTANTIATE_TEST_SUITE_P(EachLock, ModuleLockFailure,
                         ::testing::Values(L"ReplModuleNoComLock.dll", L"ReplModuleNoBaseLock.dll",
                                           L"ReplModuleNoModuleLock.dll"),
                         [](const ::testing::TestParamInfo<const wchar_t*>& info) {
                             std::wstring str(info.param);
                             return std::string(str.begin() + 10, str.end() - 4);  // "No...Lock"
                         });

}  // namespace
