#pragma once
// Reads what a compiled type library (MSFT format) stores, for the values
// that oleaut32 rewrites on the way out: it adds LIBFLAG_FHASDISKIMAGE to
// the library flags, shows the dispatch view of a dual interface without
// TYPEFLAG_FOLEAUTOMATION, and rescales the vtable offsets of a 32-bit
// library read by a 64-bit process to 8-byte slots.
#include <windows.h>
#include <oleauto.h>

#include <string>
#include <vector>

struct MsftFunc
{
    int nVtableOffset;
    int nFuncKind;
    int nInvokeKind;
    int nCallConv;
};

struct MsftType
{
    int nTypeKind;
    UINT nFlags;
    int cbSizeVft;
    std::vector<MsftFunc> vecFuncs;
};

struct MsftLibrary
{
    int nSysKind;
    UINT nFlags;
    WORD wMajor;
    WORD wMinor;
    std::vector<MsftType> vecTypes;
};

// Parses the image of a type library; false with a reason on malformed data.
bool ParseMsft(const BYTE* pData, size_t cbData, MsftLibrary& lib, std::string& strError);
