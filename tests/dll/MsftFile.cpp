#include "MsftFile.h"

#include <cstring>

namespace {

constexpr UINT kMagic = 0x5446534D;    // "MSFT"
constexpr size_t cbHeader = 0x54;      // fixed part of the header
constexpr UINT kHelpDllFlag = 0x100;   // header carries a help DLL offset
constexpr size_t cbTypeInfo = 0x64;    // one entry of the type info table

// Bounds-checked little-endian reads from the image.
class CReader
{
public:
    CReader(const BYTE* pData, size_t cbData) : m_pData(pData), m_cbData(cbData) {}
    bool Int(size_t nOffset, int& nValue) const { return Read(nOffset, &nValue, sizeof(nValue)); }
    bool Short(size_t nOffset, short& nValue) const { return Read(nOffset, &nValue, sizeof(nValue)); }

private:
    bool Read(size_t nOffset, void* pValue, size_t cb) const
    {
        if (nOffset > m_cbData || m_cbData - nOffset < cb) return false;
        std::memcpy(pValue, m_pData + nOffset, cb);
        return true;
    }
    const BYTE* m_pData;
    size_t m_cbData;
};

// Function records: a total length, then one record per function, each
// starting with its own length in the low word.
bool ReadFuncs(const CReader& reader, size_t nOffset, int cFuncs, MsftType& type)
{
    size_t nPos = nOffset + 4;
    for (int i = 0; i < cFuncs; ++i) {
        int nInfo = 0, nFkccic = 0;
        short nVtable = 0;
        if (!reader.Int(nPos, nInfo) || !reader.Short(nPos + 12, nVtable) || !reader.Int(nPos + 16, nFkccic)) {
            return false;
        }
        type.vecFuncs.push_back({nVtable, nFkccic & 0x7, (nFkccic >> 3) & 0xF, (nFkccic >> 8) & 0xF});
        size_t cbRecord = static_cast<size_t>(nInfo & 0xFFFF);
        if (cbRecord == 0) return false;
        nPos += cbRecord;
    }
    return true;
}

bool ReadType(const CReader& reader, size_t nOffset, MsftType& type)
{
    int nKind = 0, nMemOffset = 0, nElements = 0, nFlags = 0;
    short cbVft = 0;
    if (!reader.Int(nOffset, nKind) || !reader.Int(nOffset + 4, nMemOffset) || !reader.Int(nOffset + 0x18, nElements) ||
        !reader.Int(nOffset + 0x30, nFlags) || !reader.Short(nOffset + 0x4E, cbVft)) {
        return false;
    }
    type.nTypeKind = nKind & 0xF;
    type.nFlags = static_cast<UINT>(nFlags);
    type.cbSizeVft = cbVft;
    int cFuncs = nElements & 0xFFFF;
    return cFuncs == 0 || ReadFuncs(reader, static_cast<size_t>(nMemOffset), cFuncs, type);
}

}  // namespace

bool ParseMsft(const BYTE* pData, size_t cbData, MsftLibrary& lib, std::string& strError)
{
    CReader reader(pData, cbData);
    int nMagic = 0, nVarFlags = 0, nVersion = 0, nFlags = 0, cTypes = 0;
    if (!reader.Int(0, nMagic) || static_cast<UINT>(nMagic) != kMagic) {
        strError = "not an MSFT type library";
        return false;
    }
    if (!reader.Int(0x14, nVarFlags) || !reader.Int(0x18, nVersion) || !reader.Int(0x1C, nFlags) ||
        !reader.Int(0x20, cTypes) || cTypes < 0) {
        strError = "truncated header";
        return false;
    }
    lib.nSysKind = nVarFlags & 0xF;
    lib.nFlags = static_cast<UINT>(nFlags);
    lib.wMajor = static_cast<WORD>(nVersion & 0xFFFF);
    lib.wMinor = static_cast<WORD>((nVersion >> 16) & 0xFFFF);

    // Header, optional help DLL offset, one offset per type info, then the
    // segment directory whose first entry is the type info table.
    size_t nSegments = cbHeader + ((nVarFlags & kHelpDllFlag) ? 4 : 0) + 4 * static_cast<size_t>(cTypes);
    int nTypeTable = 0;
    if (!reader.Int(nSegments, nTypeTable)) {
        strError = "truncated segment directory";
        return false;
    }
    lib.vecTypes.assign(static_cast<size_t>(cTypes), MsftType{});
    for (int i = 0; i < cTypes; ++i) {
        if (!ReadType(reader, static_cast<size_t>(nTypeTable) + cbTypeInfo * i, lib.vecTypes[i])) {
            strError = "truncated type info " + std::to_string(i);
            return false;
        }
    }
    return true;
}
