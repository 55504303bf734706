#pragma once
// The one exception type of the system: it carries an HRESULT. Low-level
// routines that have no result of their own raise it (a failed VARIANT copy,
// a BSTR or narrow string that cannot be allocated). Exported functions and
// COM methods catch it and turn it into their own failure result.
#include <windows.h>

class CAtlException
{
public:
    explicit CAtlException(HRESULT hr) noexcept : m_hr(hr) {}
    HRESULT Result() const noexcept { return m_hr; }
    operator HRESULT() const noexcept { return m_hr; }

private:
    HRESULT m_hr;
};

[[noreturn]] void ThrowHResult(HRESULT hr);

// The HRESULT that stands for whatever exception reached a boundary.
HRESULT HResultFromCurrentException() noexcept;
