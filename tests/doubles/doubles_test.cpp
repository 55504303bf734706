// Checks the Python doubles on the behaviours the server's tests rely on:
// the interpreter lock, interrupts, asynchronous exceptions, the exported
// data symbol, reference counting and the VARIANT conversions.

#include "py_double_api.h"

#include <gtest/gtest.h>

#include <oleauto.h>

#include <atomic>
#include <cstring>
#include <functional>

namespace
{

constexpr DWORD kdwTimeoutMs = 5000;
// How long a thread that must stay blocked is given to (wrongly) get through.
constexpr DWORD kdwBlockedMs = 200;

// Manual-reset event.
class CEvent
{
public:
    CEvent() : m_h(CreateEventW(nullptr, TRUE, FALSE, nullptr)) {}
    ~CEvent() { CloseHandle(m_h); }
    CEvent(const CEvent&) = delete;
    CEvent& operator=(const CEvent&) = delete;

    void Set() { SetEvent(m_h); }
    bool Wait(DWORD dwMs) { return WaitForSingleObject(m_h, dwMs) == WAIT_OBJECT_0; }

private:
    HANDLE m_h;
};

// A thread running a function. A thread still running at destruction has
// already failed its test and is terminated rather than left to hang the run.
class CThread
{
public:
    explicit CThread(std::function<void()> fnBody) : m_fnBody(std::move(fnBody))
    {
        m_h = CreateThread(nullptr, 0, &CThread::Proc, this, 0, &m_dwId);
    }
    ~CThread()
    {
        if (m_h != nullptr && !Join(0))
            TerminateThread(m_h, 1);
        if (m_h != nullptr)
            CloseHandle(m_h);
    }
    CThread(const CThread&) = delete;
    CThread& operator=(const CThread&) = delete;

    bool Started() const { return m_h != nullptr; }
    DWORD Id() const { return m_dwId; }
    bool Join(DWORD dwMs) { return WaitForSingleObject(m_h, dwMs) == WAIT_OBJECT_0; }

private:
    static DWORD WINAPI Proc(LPVOID pParam)
    {
        static_cast<CThread*>(pParam)->m_fnBody();
        return 0;
    }

    std::function<void()> m_fnBody;
    DWORD m_dwId = 0;
    HANDLE m_h = nullptr;
};

// Holds the interpreter lock for one scope.
class CGil
{
public:
    CGil() : m_nState(PyGILState_Ensure()) {}
    ~CGil() { PyGILState_Release(m_nState); }
    CGil(const CGil&) = delete;
    CGil& operator=(const CGil&) = delete;

    int State() const { return m_nState; }

private:
    int m_nState;
};

// Owns one reference to an object of the double.
class CPyRef
{
public:
    explicit CPyRef(PyObject* pObj) : m_pObj(pObj) {}
    ~CPyRef()
    {
        CGil gil;
        Py_DecRef(m_pObj);
    }
    CPyRef(const CPyRef&) = delete;
    CPyRef& operator=(const CPyRef&) = delete;

    PyObject* Get() const { return m_pObj; }

private:
    PyObject* m_pObj;
};

// A VARIANT that is cleared at the end of its scope.
class CVariant : public VARIANT
{
public:
    CVariant() { VariantInit(this); }
    ~CVariant() { VariantClear(this); }
    CVariant(const CVariant&) = delete;
    CVariant& operator=(const CVariant&) = delete;
};

class CBstr
{
public:
    CBstr(const wchar_t* pwch, UINT cch) : m_bstr(SysAllocStringLen(pwch, cch)) {}
    ~CBstr() { SysFreeString(m_bstr); }
    CBstr(const CBstr&) = delete;
    CBstr& operator=(const CBstr&) = delete;

    BSTR Get() const { return m_bstr; }

private:
    BSTR m_bstr;
};

class CModule
{
public:
    explicit CModule(const wchar_t* pszName) : m_h(LoadLibraryW(pszName)) {}
    ~CModule()
    {
        if (m_h != nullptr)
            FreeLibrary(m_h);
    }
    CModule(const CModule&) = delete;
    CModule& operator=(const CModule&) = delete;

    HMODULE Get() const { return m_h; }

private:
    HMODULE m_h;
};

// Every test starts from a clean double and must leave the lock free and
// no object of its own alive.
class DoublesTest : public ::testing::Test
{
protected:
    void SetUp() override
    {
        TestPy_Reset();
        TestPyCom_Reset();
        m_nLiveBase = TestPy_LiveObjects();
    }
    void TearDown() override
    {
        EXPECT_EQ(TestPy_GilOwner(), 0u);
        EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase);
    }

    long m_nLiveBase = 0;
};

class InterpreterLock : public DoublesTest
{
};
class Interrupt : public DoublesTest
{
};
class AsyncExc : public DoublesTest
{
};
class KeyboardInterruptSymbol : public DoublesTest
{
};
class Exports : public DoublesTest
{
};
class Objects : public DoublesTest
{
};
class Conversions : public DoublesTest
{
};

// ---- interpreter lock -------------------------------------------------------

TEST_F(InterpreterLock, FirstEnsureIsUnlockedAndNestedIsLocked)
{
    const int nOuter = PyGILState_Ensure();
    EXPECT_EQ(nOuter, PYDOUBLE_GIL_UNLOCKED);
    EXPECT_EQ(TestPy_GilOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilDepth(), 1);

    const int nInner = PyGILState_Ensure();
    EXPECT_EQ(nInner, PYDOUBLE_GIL_LOCKED);
    EXPECT_EQ(TestPy_GilDepth(), 2);

    PyGILState_Release(nInner);
    EXPECT_EQ(TestPy_GilOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilDepth(), 1);

    PyGILState_Release(nOuter);
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_EQ(TestPy_GilDepth(), 0);
    EXPECT_EQ(TestPy_EnsureCalls(), 2);
    EXPECT_EQ(TestPy_ReleaseCalls(), 2);
    EXPECT_EQ(TestPy_GilErrors(), 0);
}

TEST_F(InterpreterLock, UnseenThreadTakesTheLock)
{
    std::atomic<int> nState{-1};
    std::atomic<DWORD> dwOwner{0};
    CThread thread([&] {
        CGil gil;
        nState = gil.State();
        dwOwner = TestPy_GilOwner();
    });
    ASSERT_TRUE(thread.Started());
    ASSERT_TRUE(thread.Join(kdwTimeoutMs));
    EXPECT_EQ(nState, PYDOUBLE_GIL_UNLOCKED);
    EXPECT_EQ(dwOwner, thread.Id());
}

TEST_F(InterpreterLock, HeldLockBlocksOtherThreadsUntilOutermostRelease)
{
    const int nOuter = PyGILState_Ensure();
    const int nInner = PyGILState_Ensure();
    CEvent evAcquired;
    CThread thread([&] {
        CGil gil;
        evAcquired.Set();
    });
    ASSERT_TRUE(thread.Started());
    EXPECT_FALSE(evAcquired.Wait(kdwBlockedMs));

    PyGILState_Release(nInner);
    EXPECT_FALSE(evAcquired.Wait(kdwBlockedMs));

    PyGILState_Release(nOuter);
    EXPECT_TRUE(evAcquired.Wait(kdwTimeoutMs));
    EXPECT_TRUE(thread.Join(kdwTimeoutMs));
}

TEST_F(InterpreterLock, ThreadsNeverHoldItTogether)
{
    constexpr int kThreads = 4;
    constexpr int kRounds = 300;
    std::atomic<int> nInside{0};
    std::atomic<int> nOverlaps{0};
    std::atomic<int> nRounds{0};
    auto fnWork = [&] {
        for (int i = 0; i < kRounds; ++i)
        {
            CGil gil;
            if (nInside.fetch_add(1) != 0)
                ++nOverlaps;
            Sleep(0);
            nInside.fetch_sub(1);
            ++nRounds;
        }
    };
    CThread thread0(fnWork), thread1(fnWork), thread2(fnWork), thread3(fnWork);
    for (CThread* pThread : {&thread0, &thread1, &thread2, &thread3})
        ASSERT_TRUE(pThread->Join(kdwTimeoutMs * 2));
    EXPECT_EQ(nOverlaps, 0);
    EXPECT_EQ(nRounds, kThreads * kRounds);
    EXPECT_EQ(TestPy_GilErrors(), 0);
}

TEST_F(InterpreterLock, ReleaseByNonOwnerIsAnErrorAndKeepsTheLock)
{
    CGil gil;
    CThread thread([] { PyGILState_Release(PYDOUBLE_GIL_UNLOCKED); });
    ASSERT_TRUE(thread.Join(kdwTimeoutMs));
    EXPECT_EQ(TestPy_GilErrors(), 1);
    EXPECT_EQ(TestPy_GilOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilDepth(), 1);
}

TEST_F(InterpreterLock, ReleaseWithMismatchedStateIsAnError)
{
    const int nState = PyGILState_Ensure();
    PyGILState_Release(PYDOUBLE_GIL_LOCKED);  // outermost must say UNLOCKED
    EXPECT_EQ(TestPy_GilErrors(), 1);
    EXPECT_EQ(TestPy_GilDepth(), 1);

    const int nInner = PyGILState_Ensure();
    PyGILState_Release(PYDOUBLE_GIL_UNLOCKED);  // inner must say LOCKED
    EXPECT_EQ(TestPy_GilErrors(), 2);
    EXPECT_EQ(TestPy_GilDepth(), 2);

    PyGILState_Release(nInner);
    PyGILState_Release(nState);
    EXPECT_EQ(TestPy_GilErrors(), 2);
}

TEST_F(InterpreterLock, CheckInterruptHandsTheLockToAWaiterAndTakesItBack)
{
    const int nOuter = PyGILState_Ensure();
    const int nInner = PyGILState_Ensure();
    CEvent evAcquired;
    CThread thread([&] {
        CGil gil;
        evAcquired.Set();
    });
    ASSERT_TRUE(thread.Started());
    // The waiter may not be waiting yet on the first checks.
    for (ULONGLONG qwEnd = GetTickCount64() + kdwTimeoutMs; GetTickCount64() < qwEnd;)
    {
        EXPECT_EQ(TestPy_CheckInterrupt(), 0);
        if (evAcquired.Wait(1))
            break;
    }
    EXPECT_TRUE(evAcquired.Wait(0));
    EXPECT_EQ(TestPy_GilOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilDepth(), 2);
    PyGILState_Release(nInner);
    PyGILState_Release(nOuter);
    EXPECT_TRUE(thread.Join(kdwTimeoutMs));
}

TEST_F(InterpreterLock, WaitInterruptFreesTheLockWhileWaiting)
{
    CGil gil;
    CThread thread([] {
        CGil gilInterrupter;
        PyErr_SetInterrupt();
    });
    EXPECT_EQ(TestPy_WaitInterrupt(kdwTimeoutMs), 1);
    EXPECT_EQ(TestPy_GilOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilDepth(), 1);
    EXPECT_TRUE(thread.Join(kdwTimeoutMs));
    EXPECT_EQ(TestPy_LockViolations(), 0);
}

TEST_F(InterpreterLock, ResetFreesALockLeftHeld)
{
    PyGILState_Ensure();
    TestPy_Reset();
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    EXPECT_EQ(TestPy_GilDepth(), 0);
}

// ---- interrupt --------------------------------------------------------------

TEST_F(Interrupt, SetInterruptLeavesOneInterruptPending)
{
    {
        CGil gil;
        PyErr_SetInterrupt();
        PyErr_SetInterrupt();
    }
    EXPECT_EQ(TestPy_InterruptCalls(), 2);
    EXPECT_EQ(TestPy_InterruptPending(), 1);
    EXPECT_EQ(TestPy_CheckInterrupt(), 1);
    EXPECT_EQ(TestPy_InterruptPending(), 0);
    EXPECT_EQ(TestPy_CheckInterrupt(), 0);
    EXPECT_EQ(TestPy_LockViolations(), 0);
}

TEST_F(Interrupt, SetInterruptWithoutTheLockIsAViolation)
{
    PyErr_SetInterrupt();
    EXPECT_EQ(TestPy_LockViolations(), 1);
    EXPECT_EQ(TestPy_InterruptPending(), 1);
}

TEST_F(Interrupt, WaitInterruptWakesOnAnotherThreadsInterrupt)
{
    CThread thread([] {
        Sleep(20);
        CGil gil;
        PyErr_SetInterrupt();
    });
    EXPECT_EQ(TestPy_WaitInterrupt(kdwTimeoutMs), 1);
    EXPECT_EQ(TestPy_InterruptPending(), 0);
    EXPECT_TRUE(thread.Join(kdwTimeoutMs));
}

TEST_F(Interrupt, WaitInterruptTimesOutWithoutInterrupt)
{
    EXPECT_EQ(TestPy_WaitInterrupt(50), 0);
    EXPECT_EQ(TestPy_InterruptCalls(), 0);
}

// ---- asynchronous exceptions ------------------------------------------------

TEST_F(AsyncExc, UnregisteredThreadIsNotChanged)
{
    CGil gil;
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt), 0);
    EXPECT_EQ(TestPy_CheckAsyncExc(), 0);
    ASSERT_EQ(TestPy_AsyncCallCount(), 1);
    DWORD dwThreadId = 0;
    PyObject* pExc = nullptr;
    ASSERT_EQ(TestPy_AsyncCall(0, &dwThreadId, &pExc), 1);
    EXPECT_EQ(dwThreadId, GetCurrentThreadId());
    EXPECT_EQ(pExc, PyExc_KeyboardInterrupt);
}

TEST_F(AsyncExc, RegisteredThreadReceivesTheException)
{
    CEvent evRegistered;
    std::atomic<int> nReceived{-1};
    CThread thread([&] {
        TestPy_RegisterThread();
        evRegistered.Set();
        nReceived = TestPy_WaitAsyncExc(kdwTimeoutMs);
        TestPy_UnregisterThread();
    });
    ASSERT_TRUE(evRegistered.Wait(kdwTimeoutMs));
    {
        CGil gil;
        EXPECT_EQ(PyThreadState_SetAsyncExc(thread.Id(), PyExc_KeyboardInterrupt), 1);
    }
    ASSERT_TRUE(thread.Join(kdwTimeoutMs));
    EXPECT_EQ(nReceived, 1);
    EXPECT_EQ(TestPy_LockViolations(), 0);
}

TEST_F(AsyncExc, NullExceptionWithdrawsThePendingOne)
{
    ASSERT_EQ(TestPy_RegisterThread(), 1);
    {
        CGil gil;
        EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt), 1);
        EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), nullptr), 1);
    }
    EXPECT_EQ(TestPy_CheckAsyncExc(), 0);
    ASSERT_EQ(TestPy_AsyncCallCount(), 2);
    PyObject* pExc = PyExc_KeyboardInterrupt;
    ASSERT_EQ(TestPy_AsyncCall(1, nullptr, &pExc), 1);
    EXPECT_EQ(pExc, nullptr);
}

TEST_F(AsyncExc, PendingExceptionIsConsumedOnce)
{
    ASSERT_EQ(TestPy_RegisterThread(), 1);
    {
        CGil gil;
        PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt);
    }
    EXPECT_EQ(TestPy_CheckAsyncExc(), 1);
    EXPECT_EQ(TestPy_CheckAsyncExc(), 0);
}

TEST_F(AsyncExc, OverrideReportsSeveralStatesForRegisteredThreadsOnly)
{
    ASSERT_EQ(TestPy_RegisterThread(), 1);
    TestPy_SetAsyncExcResult(3);
    CGil gil;
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt), 3);
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), nullptr), 3);
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId() + 1, PyExc_KeyboardInterrupt), 0);
    TestPy_SetAsyncExcResult(0);
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt), 1);
}

TEST_F(AsyncExc, UnregisteredAgainAfterLeaving)
{
    ASSERT_EQ(TestPy_RegisterThread(), 1);
    TestPy_UnregisterThread();
    CGil gil;
    EXPECT_EQ(PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt), 0);
}

TEST_F(AsyncExc, CallWithoutTheLockIsAViolation)
{
    PyThreadState_SetAsyncExc(GetCurrentThreadId(), PyExc_KeyboardInterrupt);
    EXPECT_EQ(TestPy_LockViolations(), 1);
}

TEST_F(AsyncExc, LogHasNoEntryOutOfRange)
{
    DWORD dwThreadId = 0;
    EXPECT_EQ(TestPy_AsyncCall(0, &dwThreadId, nullptr), 0);
    EXPECT_EQ(TestPy_AsyncCall(-1, &dwThreadId, nullptr), 0);
}

TEST_F(AsyncExc, WaitTimesOutWithoutException)
{
    ASSERT_EQ(TestPy_RegisterThread(), 1);
    EXPECT_EQ(TestPy_WaitAsyncExc(50), 0);
}

// ---- KeyboardInterrupt data export -----------------------------------------

PyObject** LookUpKeyboardInterrupt()
{
    return PyDoubleProcAs<PyObject**>(GetModuleHandleW(L"PyRuntimeDouble.dll"), "PyExc_KeyboardInterrupt");
}

TEST_F(KeyboardInterruptSymbol, LookupGivesTheVariableHoldingTheType)
{
    PyObject** ppExc = LookUpKeyboardInterrupt();
    ASSERT_NE(ppExc, nullptr);
    EXPECT_EQ(ppExc, &PyExc_KeyboardInterrupt);
    ASSERT_NE(*ppExc, nullptr);
    EXPECT_EQ(TestPy_Kind(*ppExc), PYDOUBLE_KIND_TYPE);
}

TEST_F(KeyboardInterruptSymbol, SetterEmptiesAndRestoresTheVariable)
{
    PyObject** ppExc = LookUpKeyboardInterrupt();
    ASSERT_NE(ppExc, nullptr);
    PyObject* pType = *ppExc;
    TestPy_SetKeyboardInterruptNull(1);
    EXPECT_EQ(*ppExc, nullptr);
    TestPy_SetKeyboardInterruptNull(0);
    EXPECT_EQ(*ppExc, pType);
    TestPy_SetKeyboardInterruptNull(1);
    TestPy_Reset();
    EXPECT_EQ(*ppExc, pType);
}

TEST_F(KeyboardInterruptSymbol, DroppingTheBorrowedTypeIsAReferenceError)
{
    PyObject* pType = PyExc_KeyboardInterrupt;
    ASSERT_EQ(TestPy_RefCount(pType), 1);
    {
        CGil gil;
        Py_DecRef(pType);
    }
    EXPECT_EQ(TestPy_RefErrors(), 1);
    EXPECT_EQ(TestPy_Kind(pType), PYDOUBLE_KIND_TYPE);
    TestPy_Reset();
    EXPECT_EQ(TestPy_RefCount(pType), 1);
}

// ---- exports ----------------------------------------------------------------

const char* const g_rgpszRuntimeNames[] = {
    "Py_DecRef", "PyGILState_Ensure", "PyGILState_Release", "PyThreadState_SetAsyncExc",
    "PyExc_KeyboardInterrupt",
};

TEST_F(Exports, RuntimeDoubleExportsEveryName)
{
    const HMODULE hModule = GetModuleHandleW(L"PyRuntimeDouble.dll");
    ASSERT_NE(hModule, nullptr);
    for (const char* pszName : g_rgpszRuntimeNames)
        EXPECT_NE(GetProcAddress(hModule, pszName), nullptr) << pszName;
    EXPECT_NE(GetProcAddress(hModule, "PyErr_SetInterrupt"), nullptr);
}

TEST_F(Exports, NoInterruptVariantLacksOnlySetInterrupt)
{
    CModule module(L"PyRuntimeNoInterrupt.dll");
    ASSERT_NE(module.Get(), nullptr);
    for (const char* pszName : g_rgpszRuntimeNames)
        EXPECT_NE(GetProcAddress(module.Get(), pszName), nullptr) << pszName;
    EXPECT_EQ(GetProcAddress(module.Get(), "PyErr_SetInterrupt"), nullptr);
}

TEST_F(Exports, NoInterruptVariantHasItsOwnLock)
{
    CModule module(L"PyRuntimeNoInterrupt.dll");
    ASSERT_NE(module.Get(), nullptr);
    auto pfnEnsure = PYDOUBLE_PROC(module.Get(), PyGILState_Ensure);
    auto pfnRelease = PYDOUBLE_PROC(module.Get(), PyGILState_Release);
    auto pfnOwner = PYDOUBLE_PROC(module.Get(), TestPy_GilOwner);
    ASSERT_TRUE(pfnEnsure && pfnRelease && pfnOwner);
    const int nState = pfnEnsure();
    EXPECT_EQ(nState, PYDOUBLE_GIL_UNLOCKED);
    EXPECT_EQ(pfnOwner(), GetCurrentThreadId());
    EXPECT_EQ(TestPy_GilOwner(), 0u);
    pfnRelease(nState);
    EXPECT_EQ(pfnOwner(), 0u);
}

TEST_F(Exports, ComDoubleExportsBothConversions)
{
    const HMODULE hModule = GetModuleHandleW(L"PyComDouble.dll");
    ASSERT_NE(hModule, nullptr);
    EXPECT_NE(GetProcAddress(hModule, "PyCom_PyObjectFromVariant"), nullptr);
    EXPECT_NE(GetProcAddress(hModule, "PyCom_VariantFromPyObject"), nullptr);
}

// ---- objects and reference counts ------------------------------------------

TEST_F(Objects, NewObjectHasOneReferenceAndIsFreedAtZero)
{
    PyObject* pObj = TestPy_NewInt(42);
    ASSERT_NE(pObj, nullptr);
    EXPECT_EQ(TestPy_Kind(pObj), PYDOUBLE_KIND_INT);
    EXPECT_EQ(TestPy_Int(pObj), 42);
    EXPECT_EQ(TestPy_RefCount(pObj), 1);
    EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase + 1);

    TestPy_IncRef(pObj);
    EXPECT_EQ(TestPy_RefCount(pObj), 2);
    CGil gil;
    Py_DecRef(pObj);
    EXPECT_EQ(TestPy_RefCount(pObj), 1);
    EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase + 1);
    Py_DecRef(pObj);
    EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase);
    EXPECT_EQ(TestPy_RefErrors(), 0);
    EXPECT_EQ(TestPy_LockViolations(), 0);
}

TEST_F(Objects, UseAfterFreeIsAReferenceError)
{
    PyObject* pObj = TestPy_NewNone();
    ASSERT_NE(pObj, nullptr);
    CGil gil;
    Py_DecRef(pObj);
    Py_DecRef(pObj);
    EXPECT_EQ(TestPy_RefErrors(), 1);
    EXPECT_EQ(TestPy_Kind(pObj), PYDOUBLE_KIND_INVALID);
    EXPECT_EQ(TestPy_RefErrors(), 2);
    EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase);
}

TEST_F(Objects, ForeignPointerIsAReferenceError)
{
    long long nNotAnObject = 0;
    CGil gil;
    Py_DecRef(reinterpret_cast<PyObject*>(&nNotAnObject));
    EXPECT_EQ(TestPy_RefErrors(), 1);
    EXPECT_EQ(nNotAnObject, 0);
}

TEST_F(Objects, DecRefWithoutTheLockIsAViolation)
{
    PyObject* pObj = TestPy_NewInt(1);
    ASSERT_NE(pObj, nullptr);
    Py_DecRef(pObj);
    EXPECT_EQ(TestPy_LockViolations(), 1);
    EXPECT_EQ(TestPy_LiveObjects(), m_nLiveBase);
}

TEST_F(Objects, DecRefOfNullIsIgnored)
{
    Py_DecRef(nullptr);
    EXPECT_EQ(TestPy_LockViolations(), 0);
    EXPECT_EQ(TestPy_RefErrors(), 0);
}

TEST_F(Objects, StrKeepsItsLengthAndEmbeddedNulls)
{
    CPyRef str(TestPy_NewStrN(L"a\0b", 3));
    ASSERT_EQ(TestPy_Kind(str.Get()), PYDOUBLE_KIND_STR);
    ASSERT_EQ(TestPy_StrLen(str.Get()), 3);
    EXPECT_EQ(std::memcmp(TestPy_Str(str.Get()), L"a\0b", 3 * sizeof(wchar_t)), 0);

    CPyRef empty(TestPy_NewStr(nullptr));
    EXPECT_EQ(TestPy_StrLen(empty.Get()), 0);
    EXPECT_EQ(TestPy_NewStrN(L"x", -1), nullptr);
}

TEST_F(Objects, ReadersRejectOtherKinds)
{
    CPyRef num(TestPy_NewInt(5));
    CPyRef str(TestPy_NewStr(L"5"));
    CPyRef other(TestPy_NewUnconvertible());
    EXPECT_EQ(TestPy_Kind(other.Get()), PYDOUBLE_KIND_UNCONVERTIBLE);
    EXPECT_EQ(TestPy_Str(num.Get()), nullptr);
    EXPECT_EQ(TestPy_StrLen(num.Get()), -1);
    EXPECT_EQ(TestPy_Int(str.Get()), 0);
    EXPECT_EQ(TestPy_RefErrors(), 0);
}

TEST_F(Objects, ResetKeepsLiveObjects)
{
    CPyRef num(TestPy_NewInt(7));
    TestPy_Reset();
    EXPECT_EQ(TestPy_Kind(num.Get()), PYDOUBLE_KIND_INT);
    EXPECT_EQ(TestPy_Int(num.Get()), 7);
}

// ---- VARIANT conversions ----------------------------------------------------

// Converts under the lock and returns the new object, owned by the caller.
PyObject* FromVariant(VARIANT& var)
{
    CGil gil;
    return PyCom_PyObjectFromVariant(&var);
}

TEST_F(Conversions, EmptyBecomesNone)
{
    CVariant var;
    CPyRef obj(FromVariant(var));
    EXPECT_EQ(TestPy_Kind(obj.Get()), PYDOUBLE_KIND_NONE);
    EXPECT_EQ(TestPy_RefCount(obj.Get()), 1);
}

TEST_F(Conversions, IntegersAndBoolsBecomeInts)
{
    CVariant varI4, varI2, varTrue, varFalse;
    V_VT(&varI4) = VT_I4;
    V_I4(&varI4) = -70000;
    V_VT(&varI2) = VT_I2;
    V_I2(&varI2) = -7;
    V_VT(&varTrue) = VT_BOOL;
    V_BOOL(&varTrue) = VARIANT_TRUE;
    V_VT(&varFalse) = VT_BOOL;
    V_BOOL(&varFalse) = VARIANT_FALSE;

    CPyRef objI4(FromVariant(varI4)), objI2(FromVariant(varI2));
    CPyRef objTrue(FromVariant(varTrue)), objFalse(FromVariant(varFalse));
    EXPECT_EQ(TestPy_Kind(objI4.Get()), PYDOUBLE_KIND_INT);
    EXPECT_EQ(TestPy_Int(objI4.Get()), -70000);
    EXPECT_EQ(TestPy_Int(objI2.Get()), -7);
    EXPECT_EQ(TestPy_Int(objTrue.Get()), 1);
    EXPECT_EQ(TestPy_Kind(objFalse.Get()), PYDOUBLE_KIND_INT);
    EXPECT_EQ(TestPy_Int(objFalse.Get()), 0);
}

TEST_F(Conversions, BstrBecomesAStrCopy)
{
    CBstr bstr(L"h\u00e9\0llo", 6);
    CVariant var;
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = bstr.Get();
    CPyRef obj(FromVariant(var));
    V_VT(&var) = VT_EMPTY;  // the BSTR stays bstr's
    ASSERT_EQ(TestPy_Kind(obj.Get()), PYDOUBLE_KIND_STR);
    ASSERT_EQ(TestPy_StrLen(obj.Get()), 6);
    EXPECT_NE(TestPy_Str(obj.Get()), bstr.Get());
    EXPECT_EQ(std::memcmp(TestPy_Str(obj.Get()), bstr.Get(), 6 * sizeof(wchar_t)), 0);
}

TEST_F(Conversions, NullBstrBecomesEmptyStr)
{
    CVariant var;
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = nullptr;
    CPyRef obj(FromVariant(var));
    ASSERT_EQ(TestPy_Kind(obj.Get()), PYDOUBLE_KIND_STR);
    EXPECT_EQ(TestPy_StrLen(obj.Get()), 0);
}

TEST_F(Conversions, OtherVariantTypesFail)
{
    for (VARTYPE vt : {VT_NULL, VT_R8, VT_I8, VT_DISPATCH, VT_UNKNOWN, VT_DATE})
    {
        CVariant var;
        V_VT(&var) = vt;
        V_R8(&var) = 0;  // zero payload, also a null pointer for the interfaces
        EXPECT_EQ(FromVariant(var), nullptr) << vt;
        V_VT(&var) = VT_EMPTY;
    }
    EXPECT_EQ(TestPyCom_FromVariantCalls(), 6);
}

TEST_F(Conversions, FromVariantWithoutTheLockIsAViolation)
{
    CVariant var;
    CPyRef obj(PyCom_PyObjectFromVariant(&var));
    EXPECT_EQ(TestPy_LockViolations(), 1);
}

// Converts under the lock into var (which must be clear).
BOOL ToVariant(PyObject* pObj, VARIANT& var)
{
    CGil gil;
    return PyCom_VariantFromPyObject(pObj, &var);
}

TEST_F(Conversions, NoneBecomesEmpty)
{
    CPyRef obj(TestPy_NewNone());
    CVariant var;
    V_VT(&var) = VT_I4;
    EXPECT_TRUE(ToVariant(obj.Get(), var));
    EXPECT_EQ(V_VT(&var), VT_EMPTY);
}

TEST_F(Conversions, IntBecomesI4WhenItFits)
{
    CPyRef small(TestPy_NewInt(-123456));
    CPyRef big(TestPy_NewInt(1LL << 40));
    CVariant varSmall, varBig;
    EXPECT_TRUE(ToVariant(small.Get(), varSmall));
    EXPECT_EQ(V_VT(&varSmall), VT_I4);
    EXPECT_EQ(V_I4(&varSmall), -123456);
    EXPECT_FALSE(ToVariant(big.Get(), varBig));
    EXPECT_EQ(V_VT(&varBig), VT_EMPTY);
}

TEST_F(Conversions, StrBecomesANewBstr)
{
    CPyRef obj(TestPy_NewStrN(L"a\0z", 3));
    CVariant var;
    EXPECT_TRUE(ToVariant(obj.Get(), var));
    ASSERT_EQ(V_VT(&var), VT_BSTR);
    ASSERT_EQ(SysStringLen(V_BSTR(&var)), 3u);
    EXPECT_EQ(std::memcmp(V_BSTR(&var), L"a\0z", 3 * sizeof(wchar_t)), 0);
    EXPECT_EQ(TestPyCom_BstrAllocs(), 1);
    EXPECT_EQ(TestPy_RefCount(obj.Get()), 1);  // the argument is borrowed
}

TEST_F(Conversions, UnconvertibleObjectsFail)
{
    CPyRef other(TestPy_NewUnconvertible());
    CVariant var;
    EXPECT_FALSE(ToVariant(other.Get(), var));
    EXPECT_FALSE(ToVariant(PyExc_KeyboardInterrupt, var));
    EXPECT_FALSE(ToVariant(nullptr, var));
    EXPECT_EQ(V_VT(&var), VT_EMPTY);
    EXPECT_EQ(TestPyCom_ToVariantCalls(), 3);
    EXPECT_EQ(TestPyCom_BstrAllocs(), 0);
}

TEST_F(Conversions, FreedObjectFailsAsAReferenceError)
{
    PyObject* pObj = TestPy_NewStr(L"gone");
    {
        CGil gil;
        Py_DecRef(pObj);
    }
    CVariant var;
    EXPECT_FALSE(ToVariant(pObj, var));
    EXPECT_EQ(TestPy_RefErrors(), 1);
}

TEST_F(Conversions, ToVariantWithoutTheLockIsAViolation)
{
    CPyRef obj(TestPy_NewInt(1));
    CVariant var;
    EXPECT_TRUE(PyCom_VariantFromPyObject(obj.Get(), &var));
    EXPECT_EQ(TestPy_LockViolations(), 1);
}

}  // namespace
