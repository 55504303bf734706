#pragma once
// Shared helpers of the client library's tests.
#include <windows.h>
#include <objbase.h>

#include <gtest/gtest.h>

#include <string>

#include "client/HostProcess.h"
#include "client/MessagePump.h"
#include "common/Raii.h"

// Every waiting step of these tests is bounded by this.
constexpr DWORD kWaitMs = 20000;

// Each test runs in a single-threaded apartment, as a client's main thread does.
class ComTest : public ::testing::Test
{
protected:
    void SetUp() override { ASSERT_HRESULT_SUCCEEDED(::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED)); }
    void TearDown() override { ::CoUninitialize(); }
};

// A program next to the test, quoted, with arguments.
inline std::wstring SiblingCommand(const wchar_t* pszProgram, const std::wstring& strArgs)
{
    return QuoteArg(ProgramDirectory() + L"\\" + pszProgram) + (strArgs.empty() ? L"" : L" " + strArgs);
}

inline std::wstring ChildCommand(const std::wstring& strArgs)
{
    return SiblingCommand(L"replclient_test_child.exe", strArgs);
}

// Pumps until the captured output of a process contains the text.
inline bool WaitForOutput(const CHostProcess& host, const std::string& strText, DWORD dwTimeoutMs = kWaitMs)
{
    return PumpUntil([&] { return host.Output().find(strText) != std::string::npos; }, dwTimeoutMs);
}
