#pragma once
// The client text: the client's IDispatch marshalled for another process on
// this machine and written as Base64, the form the host passes on to the
// server's entry point.
#include <windows.h>
#include <oaidl.h>

#include <string>
#include <vector>

// Standard Base64 (RFC 4648 alphabet, '=' padding, no line breaks).
std::string Base64Encode(const void* pvData, size_t cbData);
// Strict decoder for our own texts: the standard alphabet, padding allowed
// only at the end, nothing else. False for anything malformed.
bool Base64DecodeStrict(const std::string& strText, std::vector<BYTE>& vecOut);

// Marshals pDispatch (CoMarshalInterface for IID_IDispatch, MSHCTX_LOCAL,
// MSHLFLAGS_NORMAL, into a stream over global memory) and returns the
// packet as Base64; empty on failure, with the reason in *phr when given.
// Call it on the apartment thread that will serve the object's calls.
// The packet holds a reference until it is unmarshalled once; a text that is
// never unmarshalled is given back with ReleaseMarshalText.
std::string MarshalToBase64(IDispatch* pDispatch, HRESULT* phr = nullptr);

// The raw marshalling packet behind a text (for tests and diagnostics).
HRESULT UnmarshalFromBase64(const std::string& strText, IDispatch** ppDispatch);
// CoReleaseMarshalData for a text that was never unmarshalled.
HRESULT ReleaseMarshalText(const std::string& strText);
