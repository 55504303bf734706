#include "client/InterruptPipe.h"

HRESULT CInterruptPipe::Create()
{
    m_hRead.Reset();
    m_hWrite.Reset();
    SECURITY_ATTRIBUTES sa = {sizeof(sa), nullptr, TRUE};
    HANDLE hRead = nullptr, hWrite = nullptr;
    if (!::CreatePipe(&hRead, &hWrite, &sa, 0)) return HRESULT_FROM_WIN32(::GetLastError());
    m_hRead.Reset(hRead);
    m_hWrite.Reset(hWrite);
    // Only the read end belongs to the host; a host holding a write end
    // would keep its own reads from ever ending.
    if (!::SetHandleInformation(hWrite, HANDLE_FLAG_INHERIT, 0)) {
        HRESULT hr = HRESULT_FROM_WIN32(::GetLastError());
        m_hRead.Reset();
        m_hWrite.Reset();
        return hr;
    }
    return S_OK;
}

std::wstring CInterruptPipe::ReadHandleText() const
{
    return std::to_wstring(reinterpret_cast<ULONG_PTR>(m_hRead.Get()));
}

bool CInterruptPipe::Send(char chCommand) const noexcept
{
    return SendRaw(&chCommand, 1);
}

bool CInterruptPipe::SendRaw(const void* pvData, DWORD cbData) const noexcept
{
    if (!m_hWrite) return false;
    DWORD cbWritten = 0;
    return ::WriteFile(m_hWrite.Get(), pvData, cbData, &cbWritten, nullptr) && cbWritten == cbData;
}

bool CInterruptPipe::SendRaw(const std::string& strData) const noexcept
{
    return SendRaw(strData.data(), static_cast<DWORD>(strData.size()));
}
