// Stand-in for the CPython runtime DLL. Built twice from this source: once
// complete (PyRuntimeDouble) and once without PyErr_SetInterrupt
// (PYDOUBLE_NO_SET_INTERRUPT, PyRuntimeNoInterrupt).

#define PYDOUBLE_BUILD_RUNTIME
#include "py_double_api.h"

#include <cwchar>
#include <map>
#include <new>
#include <string>
#include <unordered_set>
#include <vector>

struct _object
{
    long m_nRefs;
    int m_nKind;
    long long m_nValue;
    std::wstring m_strValue;
    bool m_bAlive;
};

namespace
{

// Exclusive hold of an SRW lock for one scope; also the waiting side of a
// condition variable bound to that lock.
class CSrwGuard
{
public:
    explicit CSrwGuard(SRWLOCK& srw) : m_srw(srw) { AcquireSRWLockExclusive(&m_srw); }
    ~CSrwGuard() { ReleaseSRWLockExclusive(&m_srw); }
    CSrwGuard(const CSrwGuard&) = delete;
    CSrwGuard& operator=(const CSrwGuard&) = delete;

    void Wait(CONDITION_VARIABLE& cv) { SleepConditionVariableSRW(&cv, &m_srw, INFINITE, 0); }
    void WaitFor(CONDITION_VARIABLE& cv, DWORD dwMs) { SleepConditionVariableSRW(&cv, &m_srw, dwMs, 0); }

private:
    SRWLOCK& m_srw;
};

// Milliseconds left until a point in time fixed at construction.
class CDeadline
{
public:
    explicit CDeadline(DWORD dwMs) : m_qwEnd(GetTickCount64() + dwMs) {}
    DWORD Remaining() const
    {
        const ULONGLONG qwNow = GetTickCount64();
        return qwNow >= m_qwEnd ? 0 : static_cast<DWORD>(m_qwEnd - qwNow);
    }

private:
    ULONGLONG m_qwEnd;
};

// The interpreter lock: one owner thread at a time, nesting per owner.
class CInterpreterLock
{
public:
    static constexpr DWORD kdwHandOverMs = 1000;

    int Ensure()
    {
        CSrwGuard guard(m_srw);
        ++m_nEnsureCalls;
        if (m_dwOwner == GetCurrentThreadId())
        {
            ++m_nDepth;
            return PYDOUBLE_GIL_LOCKED;
        }
        AcquireLocked(guard, 1);
        return PYDOUBLE_GIL_UNLOCKED;
    }

    void Release(int nState)
    {
        CSrwGuard guard(m_srw);
        ++m_nReleaseCalls;
        // The outermost release must say UNLOCKED, every inner one LOCKED.
        const int nExpected = m_nDepth == 1 ? PYDOUBLE_GIL_UNLOCKED : PYDOUBLE_GIL_LOCKED;
        if (m_dwOwner != GetCurrentThreadId() || nState != nExpected)
        {
            ++m_nErrors;
            return;
        }
        if (--m_nDepth == 0)
            FreeLocked();
    }

    bool HeldByCaller()
    {
        CSrwGuard guard(m_srw);
        return m_dwOwner == GetCurrentThreadId();
    }

    // Drops the lock completely if the caller holds it, as CPython does around
    // a blocking call; returns the depth that Resume restores.
    int Suspend()
    {
        CSrwGuard guard(m_srw);
        if (m_dwOwner != GetCurrentThreadId())
            return 0;
        const int nDepth = m_nDepth;
        FreeLocked();
        return nDepth;
    }

    void Resume(int nDepth)
    {
        if (nDepth <= 0)
            return;
        CSrwGuard guard(m_srw);
        AcquireLocked(guard, nDepth);
    }

    // Hands the lock to a waiting thread and takes it back once that thread
    // has had it, so that a host that "runs code" holding the lock cannot
    // starve the others.
    void HandOver()
    {
        CSrwGuard guard(m_srw);
        if (m_dwOwner != GetCurrentThreadId() || m_nWaiters == 0)
            return;
        const int nDepth = m_nDepth;
        const unsigned nSeen = m_nAcquisitions;
        FreeLocked();
        // Bounded: a waiter killed by a failed test never takes its turn.
        const CDeadline deadline(kdwHandOverMs);
        while (m_nAcquisitions == nSeen && deadline.Remaining() != 0)
            guard.WaitFor(m_cv, deadline.Remaining());
        AcquireLocked(guard, nDepth);
    }

    DWORD Owner() { return Read(m_dwOwner); }
    int Depth() { return Read(m_nDepth); }
    long EnsureCalls() { return Read(m_nEnsureCalls); }
    long ReleaseCalls() { return Read(m_nReleaseCalls); }
    long Errors() { return Read(m_nErrors); }

    void Reset()
    {
        CSrwGuard guard(m_srw);
        m_nEnsureCalls = m_nReleaseCalls = m_nErrors = 0;
        m_nWaiters = 0;  // nobody waits between tests, except killed threads
        FreeLocked();
    }

private:
    template <typename T>
    T Read(const T& value)
    {
        CSrwGuard guard(m_srw);
        return value;
    }

    void AcquireLocked(CSrwGuard& guard, int nDepth)
    {
        ++m_nWaiters;
        while (m_dwOwner != 0)
            guard.Wait(m_cv);
        --m_nWaiters;
        m_dwOwner = GetCurrentThreadId();
        m_nDepth = nDepth;
        ++m_nAcquisitions;
        WakeAllConditionVariable(&m_cv);  // a yielding thread waits for this
    }

    void FreeLocked()
    {
        m_dwOwner = 0;
        m_nDepth = 0;
        WakeAllConditionVariable(&m_cv);
    }

    SRWLOCK m_srw = SRWLOCK_INIT;
    CONDITION_VARIABLE m_cv = CONDITION_VARIABLE_INIT;
    DWORD m_dwOwner = 0;
    int m_nDepth = 0;
    int m_nWaiters = 0;
    unsigned m_nAcquisitions = 0;
    long m_nEnsureCalls = 0;
    long m_nReleaseCalls = 0;
    long m_nErrors = 0;
};

CInterpreterLock g_gil;

// Violations of "touch Python only with the lock held".
class CViolationCounter
{
public:
    bool Require()
    {
        if (g_gil.HeldByCaller())
            return true;
        InterlockedIncrement(&m_nCount);
        return false;
    }
    long Count() { return InterlockedCompareExchange(&m_nCount, 0, 0); }
    void Reset() { InterlockedExchange(&m_nCount, 0); }

private:
    LONG m_nCount = 0;
};

CViolationCounter g_violations;

// The KeyboardInterrupt type: static, never freed; refcount 1 so that a
// spurious decref by its borrower shows as a reference error.
PyObject g_typeKeyboardInterrupt = {1, PYDOUBLE_KIND_TYPE, 0, L"KeyboardInterrupt", true};

// Every object the double made. Objects freed by refcount stay allocated
// (marked dead) until Reset, so a late use is detected instead of crashing.
class CObjectHeap
{
public:
    PyObject* Make(int nKind, long long nValue, const wchar_t* pwch, size_t cch)
    {
        try
        {
            PyObject* pObj = new PyObject{1, nKind, nValue, std::wstring(pwch, cch), true};
            CSrwGuard guard(m_srw);
            try
            {
                m_setAll.insert(pObj);
            }
            catch (...)
            {
                delete pObj;
                return nullptr;
            }
            ++m_nLive;
            return pObj;
        }
        catch (...)
        {
            return nullptr;
        }
    }

    // Runs fnRead on a live object under the heap lock; counts an error and
    // returns fallback otherwise.
    template <typename T, typename F>
    T Read(PyObject* pObj, T fallback, F fnRead)
    {
        if (pObj == nullptr)
            return fallback;
        CSrwGuard guard(m_srw);
        if (!IsAliveLocked(pObj))
        {
            ++m_nErrors;
            return fallback;
        }
        return fnRead(*pObj);
    }

    void IncRef(PyObject* pObj)
    {
        if (pObj == nullptr)
            return;
        CSrwGuard guard(m_srw);
        if (!IsAliveLocked(pObj))
            ++m_nErrors;
        else
            ++pObj->m_nRefs;
    }

    void DecRef(PyObject* pObj)
    {
        CSrwGuard guard(m_srw);
        if (!IsAliveLocked(pObj))
        {
            ++m_nErrors;
            return;
        }
        if (--pObj->m_nRefs > 0)
            return;
        if (pObj == &g_typeKeyboardInterrupt)
        {
            ++m_nErrors;  // a borrowed reference was dropped
            return;
        }
        pObj->m_bAlive = false;
        --m_nLive;
    }

    long Live() { return ReadCounter(m_nLive); }
    long Errors() { return ReadCounter(m_nErrors); }

    void Reset()
    {
        CSrwGuard guard(m_srw);
        for (auto it = m_setAll.begin(); it != m_setAll.end();)
        {
            if ((*it)->m_bAlive)
            {
                ++it;
                continue;
            }
            delete *it;
            it = m_setAll.erase(it);
        }
        m_nErrors = 0;
        g_typeKeyboardInterrupt.m_nRefs = 1;
    }

private:
    bool IsAliveLocked(PyObject* pObj) const
    {
        if (pObj == &g_typeKeyboardInterrupt)
            return true;
        return pObj != nullptr && m_setAll.count(pObj) != 0 && pObj->m_bAlive;
    }

    long ReadCounter(const long& nValue)
    {
        CSrwGuard guard(m_srw);
        return nValue;
    }

    SRWLOCK m_srw = SRWLOCK_INIT;
    std::unordered_set<PyObject*> m_setAll;
    long m_nLive = 0;
    long m_nErrors = 0;
};

CObjectHeap g_heap;

// The interrupt flag that PyErr_SetInterrupt raises and the host's
// "interpreter" consumes at its next check.
class CInterruptFlag
{
public:
    void Set()
    {
        CSrwGuard guard(m_srw);
        m_bPending = true;
        ++m_nCalls;
        WakeAllConditionVariable(&m_cv);
    }

    bool Consume()
    {
        CSrwGuard guard(m_srw);
        return ConsumeLocked();
    }

    bool WaitAndConsume(DWORD dwMs)
    {
        const CDeadline deadline(dwMs);
        CSrwGuard guard(m_srw);
        while (!m_bPending && deadline.Remaining() != 0)
            guard.WaitFor(m_cv, deadline.Remaining());
        return ConsumeLocked();
    }

    bool Pending()
    {
        CSrwGuard guard(m_srw);
        return m_bPending;
    }

    long Calls()
    {
        CSrwGuard guard(m_srw);
        return m_nCalls;
    }

    void Reset()
    {
        CSrwGuard guard(m_srw);
        m_bPending = false;
        m_nCalls = 0;
    }

private:
    bool ConsumeLocked()
    {
        const bool bWas = m_bPending;
        m_bPending = false;
        return bWas;
    }

    SRWLOCK m_srw = SRWLOCK_INIT;
    CONDITION_VARIABLE m_cv = CONDITION_VARIABLE_INIT;
    bool m_bPending = false;
    long m_nCalls = 0;
};

CInterruptFlag g_interrupt;

struct AsyncCall
{
    DWORD m_dwThreadId;
    PyObject* m_pExc;
};

// Threads that "run Python code", their pending asynchronous exceptions
// (borrowed pointers, as the only exception sent is a static type) and the
// log of PyThreadState_SetAsyncExc calls.
class CAsyncExcTable
{
public:
    int Set(DWORD dwThreadId, PyObject* pExc)
    {
        CSrwGuard guard(m_srw);
        try
        {
            m_vecLog.push_back(AsyncCall{dwThreadId, pExc});
        }
        catch (...)
        {
            // The log is for tests only; the call still takes effect.
        }
        auto it = m_mapPending.find(dwThreadId);
        if (it == m_mapPending.end())
            return 0;
        it->second = pExc;
        WakeAllConditionVariable(&m_cv);
        return m_nResult > 0 ? m_nResult : 1;
    }

    bool Register()
    {
        CSrwGuard guard(m_srw);
        try
        {
            m_mapPending.emplace(GetCurrentThreadId(), nullptr);
            return true;
        }
        catch (...)
        {
            return false;
        }
    }

    void Unregister()
    {
        CSrwGuard guard(m_srw);
        m_mapPending.erase(GetCurrentThreadId());
    }

    bool Consume()
    {
        CSrwGuard guard(m_srw);
        return ConsumeLocked();
    }

    bool WaitAndConsume(DWORD dwMs)
    {
        const CDeadline deadline(dwMs);
        CSrwGuard guard(m_srw);
        while (!PendingLocked() && deadline.Remaining() != 0)
            guard.WaitFor(m_cv, deadline.Remaining());
        return ConsumeLocked();
    }

    int CallCount()
    {
        CSrwGuard guard(m_srw);
        return static_cast<int>(m_vecLog.size());
    }

    bool Call(int nIndex, DWORD* pdwThreadId, PyObject** ppExc)
    {
        CSrwGuard guard(m_srw);
        if (nIndex < 0 || static_cast<size_t>(nIndex) >= m_vecLog.size())
            return false;
        if (pdwThreadId)
            *pdwThreadId = m_vecLog[nIndex].m_dwThreadId;
        if (ppExc)
            *ppExc = m_vecLog[nIndex].m_pExc;
        return true;
    }

    void SetResult(int nResult)
    {
        CSrwGuard guard(m_srw);
        m_nResult = nResult;
    }

    void Reset()
    {
        CSrwGuard guard(m_srw);
        m_mapPending.clear();
        m_vecLog.clear();
        m_nResult = 0;
    }

private:
    bool PendingLocked() const
    {
        auto it = m_mapPending.find(GetCurrentThreadId());
        return it != m_mapPending.end() && it->second != nullptr;
    }

    bool ConsumeLocked()
    {
        auto it = m_mapPending.find(GetCurrentThreadId());
        if (it == m_mapPending.end() || it->second == nullptr)
            return false;
        it->second = nullptr;
        return true;
    }

    SRWLOCK m_srw = SRWLOCK_INIT;
    CONDITION_VARIABLE m_cv = CONDITION_VARIABLE_INIT;
    std::map<DWORD, PyObject*> m_mapPending;
    std::vector<AsyncCall> m_vecLog;
    int m_nResult = 0;
};

CAsyncExcTable g_asyncExc;

// Holds no interpreter lock for one scope: a blocking wait in "Python code".
class CGilSuspension
{
public:
    CGilSuspension() : m_nDepth(g_gil.Suspend()) {}
    ~CGilSuspension() { g_gil.Resume(m_nDepth); }
    CGilSuspension(const CGilSuspension&) = delete;
    CGilSuspension& operator=(const CGilSuspension&) = delete;

private:
    int m_nDepth;
};

}  // namespace

extern "C" {

PyObject* PyExc_KeyboardInterrupt = &g_typeKeyboardInterrupt;

int __cdecl PyGILState_Ensure(void)
{
    return g_gil.Ensure();
}

void __cdecl PyGILState_Release(int nState)
{
    g_gil.Release(nState);
}

#if !defined(PYDOUBLE_NO_SET_INTERRUPT)
void __cdecl PyErr_SetInterrupt(void)
{
    g_violations.Require();
    g_interrupt.Set();
}
#endif

int __cdecl PyThreadState_SetAsyncExc(unsigned long dwThreadId, PyObject* pExc)
{
    g_violations.Require();
    return g_asyncExc.Set(dwThreadId, pExc);
}

void __cdecl Py_DecRef(PyObject* pObj)
{
    if (pObj == nullptr)
        return;
    g_violations.Require();
    g_heap.DecRef(pObj);
}

void __cdecl TestPy_Reset(void)
{
    g_gil.Reset();
    g_violations.Reset();
    g_heap.Reset();
    g_interrupt.Reset();
    g_asyncExc.Reset();
    PyExc_KeyboardInterrupt = &g_typeKeyboardInterrupt;
}

PyObject* __cdecl TestPy_NewNone(void)
{
    return g_heap.Make(PYDOUBLE_KIND_NONE, 0, L"", 0);
}

PyObject* __cdecl TestPy_NewInt(long long nValue)
{
    return g_heap.Make(PYDOUBLE_KIND_INT, nValue, L"", 0);
}

PyObject* __cdecl TestPy_NewStr(const wchar_t* psz)
{
    return psz ? g_heap.Make(PYDOUBLE_KIND_STR, 0, psz, wcslen(psz)) : TestPy_NewStrN(L"", 0);
}

PyObject* __cdecl TestPy_NewStrN(const wchar_t* pwch, int cch)
{
    if (cch < 0 || (pwch == nullptr && cch != 0))
        return nullptr;
    return g_heap.Make(PYDOUBLE_KIND_STR, 0, pwch ? pwch : L"", static_cast<size_t>(cch));
}

PyObject* __cdecl TestPy_NewUnconvertible(void)
{
    return g_heap.Make(PYDOUBLE_KIND_UNCONVERTIBLE, 0, L"", 0);
}

int __cdecl TestPy_Kind(PyObject* pObj)
{
    return g_heap.Read(pObj, static_cast<int>(PYDOUBLE_KIND_INVALID),
                       [](const PyObject& obj) { return obj.m_nKind; });
}

long long __cdecl TestPy_Int(PyObject* pObj)
{
    return g_heap.Read(pObj, 0LL, [](const PyObject& obj) {
        return obj.m_nKind == PYDOUBLE_KIND_INT ? obj.m_nValue : 0LL;
    });
}

const wchar_t* __cdecl TestPy_Str(PyObject* pObj)
{
    return g_heap.Read(pObj, static_cast<const wchar_t*>(nullptr), [](const PyObject& obj) {
        return obj.m_nKind == PYDOUBLE_KIND_STR ? obj.m_strValue.c_str() : nullptr;
    });
}

int __cdecl TestPy_StrLen(PyObject* pObj)
{
    return g_heap.Read(pObj, -1, [](const PyObject& obj) {
        return obj.m_nKind == PYDOUBLE_KIND_STR ? static_cast<int>(obj.m_strValue.size()) : -1;
    });
}

long __cdecl TestPy_RefCount(PyObject* pObj)
{
    return g_heap.Read(pObj, -1L, [](const PyObject& obj) { return obj.m_nRefs; });
}

void __cdecl TestPy_IncRef(PyObject* pObj)
{
    g_heap.IncRef(pObj);
}

long __cdecl TestPy_LiveObjects(void)
{
    return g_heap.Live();
}

long __cdecl TestPy_RefErrors(void)
{
    return g_heap.Errors();
}

DWORD __cdecl TestPy_GilOwner(void)
{
    return g_gil.Owner();
}

int __cdecl TestPy_GilDepth(void)
{
    return g_gil.Depth();
}

long __cdecl TestPy_EnsureCalls(void)
{
    return g_gil.EnsureCalls();
}

long __cdecl TestPy_ReleaseCalls(void)
{
    return g_gil.ReleaseCalls();
}

long __cdecl TestPy_GilErrors(void)
{
    return g_gil.Errors();
}

long __cdecl TestPy_LockViolations(void)
{
    return g_violations.Count();
}

int __cdecl TestPy_RequireLock(void)
{
    return g_violations.Require() ? 1 : 0;
}

long __cdecl TestPy_InterruptCalls(void)
{
    return g_interrupt.Calls();
}

int __cdecl TestPy_InterruptPending(void)
{
    return g_interrupt.Pending() ? 1 : 0;
}

int __cdecl TestPy_CheckInterrupt(void)
{
    g_gil.HandOver();
    return g_interrupt.Consume() ? 1 : 0;
}

int __cdecl TestPy_WaitInterrupt(DWORD dwMs)
{
    CGilSuspension suspension;
    return g_interrupt.WaitAndConsume(dwMs) ? 1 : 0;
}

int __cdecl TestPy_RegisterThread(void)
{
    return g_asyncExc.Register() ? 1 : 0;
}

void __cdecl TestPy_UnregisterThread(void)
{
    g_asyncExc.Unregister();
}

int __cdecl TestPy_CheckAsyncExc(void)
{
    g_gil.HandOver();
    return g_asyncExc.Consume() ? 1 : 0;
}

int __cdecl TestPy_WaitAsyncExc(DWORD dwMs)
{
    CGilSuspension suspension;
    return g_asyncExc.WaitAndConsume(dwMs) ? 1 : 0;
}

int __cdecl TestPy_AsyncCallCount(void)
{
    return g_asyncExc.CallCount();
}

int __cdecl TestPy_AsyncCall(int nIndex, DWORD* pdwThreadId, PyObject** ppExc)
{
    return g_asyncExc.Call(nIndex, pdwThreadId, ppExc) ? 1 : 0;
}

void __cdecl TestPy_SetAsyncExcResult(int nResult)
{
    g_asyncExc.SetResult(nResult);
}

void __cdecl TestPy_SetKeyboardInterruptNull(int bNull)
{
    PyExc_KeyboardInterrupt = bNull ? nullptr : &g_typeKeyboardInterrupt;
}

}  // extern "C"
