#pragma once
// Small owners for the platform's resources. Each one releases what it
// holds in its destructor, is movable, and is never copied implicitly.
#include <windows.h>
#include <oleauto.h>

#include <memory>
#include <utility>

#include "common/AtlException.h"

// A kernel handle closed with CloseHandle. Both null and
// INVALID_HANDLE_VALUE count as "no handle".
class CHandle
{
public:
    CHandle() noexcept = default;
    explicit CHandle(HANDLE h) noexcept : m_h(h) {}
    CHandle(CHandle&& other) noexcept : m_h(other.Detach()) {}
    CHandle& operator=(CHandle&& other) noexcept
    {
        if (this != &other) {
            Reset(other.Detach());
        }
        return *this;
    }
    CHandle(const CHandle&) = delete;
    CHandle& operator=(const CHandle&) = delete;
    ~CHandle() { Reset(); }

    HANDLE Get() const noexcept { return m_h; }
    bool IsValid() const noexcept { return m_h != nullptr && m_h != INVALID_HANDLE_VALUE; }
    explicit operator bool() const noexcept { return IsValid(); }
    HANDLE Detach() noexcept { return std::exchange(m_h, nullptr); }
    void Reset(HANDLE h = nullptr) noexcept
    {
        HANDLE hOld = std::exchange(m_h, h);
        if (hOld != nullptr && hOld != INVALID_HANDLE_VALUE) {
            ::CloseHandle(hOld);
        }
    }

private:
    HANDLE m_h = nullptr;
};

// A counted COM reference.
template <class T>
class CComPtr
{
public:
    CComPtr() noexcept = default;
    CComPtr(T* p) noexcept : m_p(p) { if (m_p) m_p->AddRef(); }
    CComPtr(const CComPtr& other) noexcept : CComPtr(other.m_p) {}
    CComPtr(CComPtr&& other) noexcept : m_p(std::exchange(other.m_p, nullptr)) {}
    ~CComPtr() { Release(); }
    CComPtr& operator=(T* p) noexcept
    {
        if (p != m_p) {
            if (p) p->AddRef();
            T* pOld = std::exchange(m_p, p);
            if (pOld) pOld->Release();
        }
        return *this;
    }
    CComPtr& operator=(const CComPtr& other) noexcept { return *this = other.m_p; }
    CComPtr& operator=(CComPtr&& other) noexcept
    {
        if (this != std::addressof(other)) {
            T* pOld = std::exchange(m_p, std::exchange(other.m_p, nullptr));
            if (pOld) pOld->Release();
        }
        return *this;
    }

    T* Get() const noexcept { return m_p; }
    T* operator->() const noexcept { return m_p; }
    operator T*() const noexcept { return m_p; }
    // For out-parameters: the pointer must be empty.
    T** operator&() noexcept { return &m_p; }
    void Attach(T* p) noexcept
    {
        T* pOld = std::exchange(m_p, p);
        if (pOld) pOld->Release();
    }
    T* Detach() noexcept { return std::exchange(m_p, nullptr); }
    void Release() noexcept
    {
        T* pOld = std::exchange(m_p, nullptr);
        if (pOld) pOld->Release();
    }

private:
    T* m_p = nullptr;
};

// An owned BSTR.
class CComBSTR
{
public:
    CComBSTR() noexcept = default;
    // Copies psz; a null psz gives a null BSTR. Raises E_OUTOFMEMORY when
    // a non-null text cannot be copied.
    explicit CComBSTR(LPCWSTR psz) : m_bstr(nullptr)
    {
        if (psz != nullptr) {
            m_bstr = ::SysAllocString(psz);
            if (m_bstr == nullptr) ThrowHResult(E_OUTOFMEMORY);
        }
    }
    CComBSTR(CComBSTR&& other) noexcept : m_bstr(other.Detach()) {}
    CComBSTR& operator=(CComBSTR&& other) noexcept
    {
        if (this != std::addressof(other)) Attach(other.Detach());
        return *this;
    }
    CComBSTR(const CComBSTR&) = delete;
    CComBSTR& operator=(const CComBSTR&) = delete;
    ~CComBSTR() { ::SysFreeString(m_bstr); }

    BSTR Get() const noexcept { return m_bstr; }
    operator BSTR() const noexcept { return m_bstr; }
    BSTR* operator&() noexcept { return &m_bstr; }
    UINT Length() const noexcept { return ::SysStringLen(m_bstr); }
    void Attach(BSTR bstr) noexcept
    {
        BSTR bstrOld = std::exchange(m_bstr, bstr);
        ::SysFreeString(bstrOld);
    }
    BSTR Detach() noexcept { return std::exchange(m_bstr, nullptr); }

private:
    BSTR m_bstr = nullptr;
};

// An owned VARIANT, cleared on destruction.
class CComVariant : public VARIANT
{
public:
    CComVariant() noexcept { ::VariantInit(this); }
    CComVariant(const CComVariant&) = delete;
    CComVariant& operator=(const CComVariant&) = delete;
    ~CComVariant() { ::VariantClear(this); }
    // Raises the HRESULT of a failed clear.
    void Clear()
    {
        HRESULT hr = ::VariantClear(this);
        if (FAILED(hr)) ThrowHResult(hr);
    }
};

// A critical section owned for its whole life. Initialization can fail
// (only on old systems under memory pressure); callers check IsValid().
class CCritSec
{
public:
    CCritSec() noexcept { m_bValid = ::InitializeCriticalSectionAndSpinCount(&m_cs, 0) != FALSE; }
    CCritSec(const CCritSec&) = delete;
    CCritSec& operator=(const CCritSec&) = delete;
    ~CCritSec() { if (m_bValid) ::DeleteCriticalSection(&m_cs); }
    bool IsValid() const noexcept { return m_bValid; }
    void Enter() noexcept { ::EnterCriticalSection(&m_cs); }
    void Leave() noexcept { ::LeaveCriticalSection(&m_cs); }
    CRITICAL_SECTION* Native() noexcept { return &m_cs; }

private:
    CRITICAL_SECTION m_cs;
    bool m_bValid;
};

// Holds a critical section for one scope.
class CCritSecLock
{
public:
    explicit CCritSecLock(CRITICAL_SECTION* pcs) noexcept : m_pcs(pcs) { ::EnterCriticalSection(m_pcs); }
    explicit CCritSecLock(CCritSec& cs) noexcept : CCritSecLock(cs.Native()) {}
    CCritSecLock(const CCritSecLock&) = delete;
    CCritSecLock& operator=(const CCritSecLock&) = delete;
    ~CCritSecLock() { ::LeaveCriticalSection(m_pcs); }

private:
    CRITICAL_SECTION* m_pcs;
};

// Holds a slim reader/writer lock exclusively for one scope.
class CSrwExclusiveLock
{
public:
    explicit CSrwExclusiveLock(SRWLOCK* pLock) noexcept : m_pLock(pLock) { ::AcquireSRWLockExclusive(m_pLock); }
    CSrwExclusiveLock(const CSrwExclusiveLock&) = delete;
    CSrwExclusiveLock& operator=(const CSrwExclusiveLock&) = delete;
    ~CSrwExclusiveLock() { ::ReleaseSRWLockExclusive(m_pLock); }

private:
    SRWLOCK* m_pLock;
};

// Holds a slim reader/writer lock shared for one scope.
class CSrwSharedLock
{
public:
    explicit CSrwSharedLock(SRWLOCK* pLock) noexcept : m_pLock(pLock) { ::AcquireSRWLockShared(m_pLock); }
    CSrwSharedLock(const CSrwSharedLock&) = delete;
    CSrwSharedLock& operator=(const CSrwSharedLock&) = delete;
    ~CSrwSharedLock() { ::ReleaseSRWLockShared(m_pLock); }

private:
    SRWLOCK* m_pLock;
};

// A movable global memory block freed with GlobalFree.
class CGlobalMem
{
public:
    CGlobalMem() noexcept = default;
    explicit CGlobalMem(HGLOBAL h) noexcept : m_h(h) {}
    CGlobalMem(const CGlobalMem&) = delete;
    CGlobalMem& operator=(const CGlobalMem&) = delete;
    ~CGlobalMem() { if (m_h) ::GlobalFree(m_h); }
    HGLOBAL Get() const noexcept { return m_h; }
    explicit operator bool() const noexcept { return m_h != nullptr; }

private:
    HGLOBAL m_h = nullptr;
};
