#include "client/Marshal.h"

#include <objbase.h>

#include "common/Raii.h"

namespace {

constexpr char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

int AlphabetValue(char ch) noexcept
{
    if (ch >= 'A' && ch <= 'Z') return ch - 'A';
    if (ch >= 'a' && ch <= 'z') return ch - 'a' + 26;
    if (ch >= '0' && ch <= '9') return ch - '0' + 52;
    if (ch == '+') return 62;
    if (ch == '/') return 63;
    return -1;
}

// A stream over a movable global block that the stream owns.
HRESULT NewGlobalStream(IStream** ppStream)
{
    return ::CreateStreamOnHGlobal(nullptr, TRUE, ppStream);
}

// The bytes written into a global-memory stream.
HRESULT StreamBytes(IStream* pStream, std::vector<BYTE>& vecBytes)
{
    HGLOBAL hGlobal = nullptr;
    HRESULT hr = ::GetHGlobalFromStream(pStream, &hGlobal);
    if (FAILED(hr)) return hr;
    STATSTG stat = {};
    hr = pStream->Stat(&stat, STATFLAG_NONAME);
    if (FAILED(hr)) return hr;
    const BYTE* pb = static_cast<const BYTE*>(::GlobalLock(hGlobal));
    if (pb == nullptr) return HRESULT_FROM_WIN32(::GetLastError());
    vecBytes.assign(pb, pb + stat.cbSize.QuadPart);
    ::GlobalUnlock(hGlobal);
    return S_OK;
}

// A stream positioned at the start of the packet behind a text.
HRESULT StreamFromText(const std::string& strText, IStream** ppStream)
{
    std::vector<BYTE> vecBytes;
    if (!Base64DecodeStrict(strText, vecBytes) || vecBytes.empty()) return E_INVALIDARG;
    CComPtr<IStream> spStream;
    HRESULT hr = NewGlobalStream(&spStream);
    if (FAILED(hr)) return hr;
    hr = spStream->Write(vecBytes.data(), static_cast<ULONG>(vecBytes.size()), nullptr);
    if (FAILED(hr)) return hr;
    LARGE_INTEGER liStart = {};
    hr = spStream->Seek(liStart, STREAM_SEEK_SET, nullptr);
    if (FAILED(hr)) return hr;
    *ppStream = spStream.Detach();
    return S_OK;
}

}  // namespace

std::string Base64Encode(const void* pvData, size_t cbData)
{
    const BYTE* pb = static_cast<const BYTE*>(pvData);
    std::string strOut;
    strOut.reserve((cbData + 2) / 3 * 4);
    for (size_t i = 0; i < cbData; i += 3) {
        size_t cbGroup = cbData - i < 3 ? cbData - i : 3;
        DWORD dwGroup = static_cast<DWORD>(pb[i]) << 16;
        if (cbGroup > 1) dwGroup |= static_cast<DWORD>(pb[i + 1]) << 8;
        if (cbGroup > 2) dwGroup |= pb[i + 2];
        for (size_t n = 0; n < 4; ++n) {
            strOut += n <= cbGroup ? kAlphabet[(dwGroup >> (18 - 6 * n)) & 0x3F] : '=';
        }
    }
    return strOut;
}

bool Base64DecodeStrict(const std::string& strText, std::vector<BYTE>& vecOut)
{
    vecOut.clear();
    if (strText.size() % 4 != 0) return false;
    size_t nPad = 0;
    while (nPad < 2 && nPad < strText.size() && strText[strText.size() - 1 - nPad] == '=') ++nPad;
    const size_t cchData = strText.size() - nPad;
    DWORD dwAcc = 0;
    int nBits = 0;
    for (size_t i = 0; i < cchData; ++i) {
        int nValue = AlphabetValue(strText[i]);
        if (nValue < 0) return false;
        dwAcc = (dwAcc << 6) | static_cast<DWORD>(nValue);
        nBits += 6;
        if (nBits >= 8) {
            nBits -= 8;
            vecOut.push_back(static_cast<BYTE>(dwAcc >> nBits));
        }
    }
    // Padding must stand for bits that are zero.
    return (dwAcc & ((1u << nBits) - 1)) == 0;
}

std::string MarshalToBase64(IDispatch* pDispatch, HRESULT* phr)
{
    HRESULT hrDummy = S_OK;
    HRESULT& hr = phr ? *phr : hrDummy;
    if (pDispatch == nullptr) {
        hr = E_POINTER;
        return std::string();
    }
    CComPtr<IStream> spStream;
    hr = NewGlobalStream(&spStream);
    if (SUCCEEDED(hr)) {
        hr = ::CoMarshalInterface(spStream, IID_IDispatch, pDispatch, MSHCTX_LOCAL, nullptr, MSHLFLAGS_NORMAL);
    }
    std::vector<BYTE> vecBytes;
    if (SUCCEEDED(hr)) hr = StreamBytes(spStream, vecBytes);
    if (FAILED(hr)) return std::string();
    return Base64Encode(vecBytes.data(), vecBytes.size());
}

HRESULT UnmarshalFromBase64(const std::string& strText, IDispatch** ppDispatch)
{
    if (ppDispatch == nullptr) return E_POINTER;
    *ppDispatch = nullptr;
    CComPtr<IStream> spStream;
    HRESULT hr = StreamFromText(strText, &spStream);
    if (FAILED(hr)) return hr;
    return ::CoUnmarshalInterface(spStream, IID_IDispatch, reinterpret_cast<void**>(ppDispatch));
}

HRESULT ReleaseMarshalText(const std::string& strText)
{
    CComPtr<IStream> spStream;
    HRESULT hr = StreamFromText(strText, &spStream);
    if (FAILED(hr)) return hr;
    return ::CoReleaseMarshalData(spStream);
}
