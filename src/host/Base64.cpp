#include "host/Base64.h"

namespace {

// The 6-bit value of an alphabet character, or -1 for any other byte.
int Base64Value(unsigned char ch) noexcept
{
    if (ch >= 'A' && ch <= 'Z') return ch - 'A';
    if (ch >= 'a' && ch <= 'z') return ch - 'a' + 26;
    if (ch >= '0' && ch <= '9') return ch - '0' + 52;
    if (ch == '+') return 62;
    if (ch == '/') return 63;
    return -1;
}

}  // namespace

bool Base64Decode(const char* pszIn, int cchIn, unsigned char* pbOut, int* pcbOut) noexcept
{
    if (pszIn == nullptr || pcbOut == nullptr) {
        return false;
    }
    const int cbCapacity = *pcbOut;
    bool bOverflow = (pbOut == nullptr);
    int cbOut = 0;
    const char* pszEnd = pszIn + (cchIn > 0 ? cchIn : 0);

    while (pszIn < pszEnd) {
        // A NUL ends the text only where a group of four starts.
        if (*pszIn == '\0') {
            break;
        }
        unsigned long dwAccum = 0;
        int nBits = 0;
        for (int nChars = 0; nChars < 4 && pszIn < pszEnd; ++pszIn) {
            int nValue = Base64Value(static_cast<unsigned char>(*pszIn));
            if (nValue < 0) {
                continue;
            }
            dwAccum = (dwAccum << 6) | static_cast<unsigned long>(nValue);
            nBits += 6;
            ++nChars;
        }
        const int cbYield = nBits / 8;
        if (!bOverflow && cbOut + cbYield > cbCapacity) {
            bOverflow = true;
        }
        dwAccum <<= (24 - nBits);
        for (int i = 0; i < cbYield; ++i) {
            if (!bOverflow) {
                pbOut[cbOut + i] = static_cast<unsigned char>((dwAccum >> 16) & 0xFF);
            }
            dwAccum <<= 8;
        }
        cbOut += cbYield;
    }
    *pcbOut = cbOut;
    return !bOverflow;
}
