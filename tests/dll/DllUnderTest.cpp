#include "DllUnderTest.h"

#include <gtest/gtest.h>

namespace {

std::vector<DllUnderTest> g_vecDlls;
std::string g_strArgError;

std::wstring Widen(const std::string& str)
{
    return std::wstring(str.begin(), str.end());  // paths of the build tree are ASCII
}

// "x86=<path>" or "x64=<path>"; an empty path is kept, so that its tests fail.
bool AddDll(const std::string& strArg)
{
    size_t nEq = strArg.find('=');
    if (nEq == std::string::npos) return false;
    std::string strArch = strArg.substr(0, nEq);
    std::wstring strPath = Widen(strArg.substr(nEq + 1));
    if (strArch == "x86") {
        g_vecDlls.push_back({strArch, strPath, SYS_WIN32, 4});
    } else if (strArch == "x64") {
        g_vecDlls.push_back({strArch, strPath, SYS_WIN64, 8});
    } else {
        return false;
    }
    return true;
}

}  // namespace

const std::vector<DllUnderTest>& DllsUnderTest()
{
    return g_vecDlls;
}

void PrintTo(const DllUnderTest& dll, std::ostream* pStream)
{
    *pStream << dll.strArch << " DLL " << std::string(dll.strPath.begin(), dll.strPath.end());
}

CDataModule::CDataModule(const std::wstring& strPath) noexcept
    : m_h(::LoadLibraryExW(strPath.c_str(), nullptr, LOAD_LIBRARY_AS_DATAFILE))
{
}

CDataModule::~CDataModule()
{
    if (m_h != nullptr) ::FreeLibrary(m_h);
}

TEST(DllArguments, NameAtLeastOneDllAndNothingElse)
{
    EXPECT_EQ(g_strArgError, "");
    EXPECT_FALSE(g_vecDlls.empty()) << "usage: <program> x86=<path> x64=<path>";
}

// The DLLs must be known before GoogleTest instantiates the parameterized
// tests, which happens inside InitGoogleTest.
int main(int argc, char** argv)
{
    for (int i = 1; i < argc; ++i) {
        std::string strArg = argv[i];
        if (strArg.rfind("--gtest", 0) == 0) continue;
        if (!AddDll(strArg)) g_strArgError += "unknown argument " + strArg + "; ";
    }
    ::testing::InitGoogleTest(&argc, argv);
    return RUN_ALL_TESTS();
}
