#pragma once
// The built DLLs a contract test reads, named on its command line as
// "<arch>=<path>" (arch x86 or x64), so that one 64-bit program checks the
// 32-bit DLL as well.
#include <windows.h>
#include <oleauto.h>

#include <ostream>
#include <string>
#include <vector>

struct DllUnderTest
{
    std::string strArch;   // "x86" or "x64"
    std::wstring strPath;
    SYSKIND sysKind;       // what its type library must say
    size_t cbPointer;      // vtable slot size of that system kind
};

const std::vector<DllUnderTest>& DllsUnderTest();
void PrintTo(const DllUnderTest& dll, std::ostream* pStream);

// Owns a module loaded as plain data (resources only, no code runs), which
// works for either bitness.
class CDataModule
{
public:
    explicit CDataModule(const std::wstring& strPath) noexcept;
    ~CDataModule();
    CDataModule(const CDataModule&) = delete;
    CDataModule& operator=(const CDataModule&) = delete;
    HMODULE Get() const noexcept { return m_h; }

private:
    HMODULE m_h;
};
