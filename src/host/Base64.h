#pragma once
// Lenient Base64 decoder for the client text: standard alphabet, padding
// optional, every byte outside the alphabet skipped.
//
// On entry *pcbOut is the capacity of pbOut; on return it is the full
// decoded length, also when that did not fit. Returns true when every
// decoded byte was stored. With a null pbOut it only measures (false).
bool Base64Decode(const char* pszIn, int cchIn, unsigned char* pbOut, int* pcbOut) noexcept;
