// The DLL's resources besides the code: the type library's place and
// language, the string table, the version block and the manifest, read
// back from each built DLL's file.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "DllUnderTest.h"

namespace {

constexpr WORD kEnglishUs = MAKELANGID(LANG_ENGLISH, SUBLANG_ENGLISH_US);  // 1033

BOOL CALLBACK CollectLanguage(HMODULE, LPCWSTR, LPCWSTR, WORD wLanguage, LONG_PTR lParam)
{
    reinterpret_cast<std::vector<WORD>*>(lParam)->push_back(wLanguage);
    return TRUE;
}

BOOL CALLBACK CollectName(HMODULE, LPCWSTR, LPWSTR pszName, LONG_PTR lParam)
{
    // Only numeric ids are expected; a named resource shows up as 0xFFFF.
    WORD wId = IS_INTRESOURCE(pszName) ? static_cast<WORD>(reinterpret_cast<ULONG_PTR>(pszName)) : 0xFFFF;
    reinterpret_cast<std::vector<WORD>*>(lParam)->push_back(wId);
    return TRUE;
}

std::string Narrow(const std::wstring& str)
{
    return std::string(str.begin(), str.end());
}

class Resources : public ::testing::TestWithParam<DllUnderTest>
{
protected:
    void SetUp() override { ASSERT_NE(m_module.Get(), nullptr) << "cannot open " << Narrow(GetParam().strPath); }

    std::vector<WORD> Languages(LPCWSTR pszType, LPCWSTR pszName) const
    {
        std::vector<WORD> vecLanguages;
        ::EnumResourceLanguagesW(m_module.Get(), pszType, pszName, CollectLanguage,
                                 reinterpret_cast<LONG_PTR>(&vecLanguages));
        return vecLanguages;
    }

    std::vector<WORD> Names(LPCWSTR pszType) const
    {
        std::vector<WORD> vecNames;
        ::EnumResourceNamesW(m_module.Get(), pszType, CollectName, reinterpret_cast<LONG_PTR>(&vecNames));
        return vecNames;
    }

    // The bytes of one resource in US English; empty when there is none.
    std::string Bytes(LPCWSTR pszType, LPCWSTR pszName) const
    {
        HRSRC hRes = ::FindResourceExW(m_module.Get(), pszType, pszName, kEnglishUs);
        if (hRes == nullptr) return std::string();
        HGLOBAL hData = ::LoadResource(m_module.Get(), hRes);
        const char* p = static_cast<const char*>(::LockResource(hData));
        return p ? std::string(p, ::SizeofResource(m_module.Get(), hRes)) : std::string();
    }

    CDataModule m_module{GetParam().strPath};
};

TEST_P(Resources, TypeLibraryIsTypelibOneInUsEnglish)
{
    EXPECT_EQ(Names(L"TYPELIB"), std::vector<WORD>{1});
    EXPECT_EQ(Languages(L"TYPELIB", MAKEINTRESOURCEW(1)), std::vector<WORD>{kEnglishUs});
    std::string strData = Bytes(L"TYPELIB", MAKEINTRESOURCEW(1));
    ASSERT_GE(strData.size(), 4u);
    EXPECT_EQ(strData.substr(0, 4), "MSFT") << "not a compiled (MSFT) type library";
}

// String 100 is entry 4 of block 7 (ids 96 to 111); each entry is a
// length followed by that many UTF-16 units.
TEST_P(Resources, StringHundredIsReplServer)
{
    std::string strBlock = Bytes(RT_STRING, MAKEINTRESOURCEW(100 / 16 + 1));
    ASSERT_FALSE(strBlock.empty()) << "no US English string block for id 100";
    std::wstring strEntry;
    size_t nPos = 0;
    for (int i = 0; i <= 100 % 16; ++i) {
        WORD cch = 0;
        ASSERT_LE(nPos + 2, strBlock.size());
        std::memcpy(&cch, strBlock.data() + nPos, 2);
        nPos += 2;
        ASSERT_LE(nPos + 2 * size_t{cch}, strBlock.size());
        strEntry.assign(reinterpret_cast<const wchar_t*>(strBlock.data() + nPos), cch);
        nPos += 2 * size_t{cch};
    }
    EXPECT_EQ(strEntry, L"ReplServer");
}

class CVersionInfo
{
public:
    explicit CVersionInfo(const std::wstring& strPath)
    {
        DWORD dwHandle = 0;
        DWORD cb = ::GetFileVersionInfoSizeW(strPath.c_str(), &dwHandle);
        m_vecData.resize(cb);
        m_bValid = cb != 0 && ::GetFileVersionInfoW(strPath.c_str(), 0, cb, m_vecData.data());
    }
    bool IsValid() const { return m_bValid; }
    const void* Value(const wchar_t* pszPath, UINT* pcb = nullptr)
    {
        void* p = nullptr;
        UINT cb = 0;
        if (!::VerQueryValueW(m_vecData.data(), pszPath, &p, &cb)) return nullptr;
        if (pcb) *pcb = cb;
        return p;
    }
    std::wstring String(const wchar_t* pszName)
    {
        std::wstring strPath = std::wstring(L"\\StringFileInfo\\040904b0\\") + pszName;
        const wchar_t* psz = static_cast<const wchar_t*>(Value(strPath.c_str()));
        return psz ? psz : L"<missing>";
    }

private:
    std::vector<BYTE> m_vecData;
    bool m_bValid = false;
};

TEST_P(Resources, VersionBlockCarriesTheFixedValues)
{
    EXPECT_EQ(Names(RT_VERSION), std::vector<WORD>{1});
    EXPECT_EQ(Languages(RT_VERSION, MAKEINTRESOURCEW(1)), std::vector<WORD>{kEnglishUs});
    CVersionInfo info(GetParam().strPath);
    ASSERT_TRUE(info.IsValid());
    UINT cb = 0;
    auto pFixed = static_cast<const VS_FIXEDFILEINFO*>(info.Value(L"\\", &cb));
    ASSERT_NE(pFixed, nullptr);
    ASSERT_GE(cb, sizeof(VS_FIXEDFILEINFO));
    EXPECT_EQ(pFixed->dwSignature, 0xFEEF04BDu);
    EXPECT_EQ(pFixed->dwFileVersionMS, 0x00010000u);  // 1.0
    EXPECT_EQ(pFixed->dwFileVersionLS, 0x00000005u);  // .0.5
    EXPECT_EQ(pFixed->dwProductVersionMS, 0u);
    EXPECT_EQ(pFixed->dwProductVersionLS, 0u);
    EXPECT_EQ(pFixed->dwFileType, static_cast<DWORD>(VFT_DLL));
    EXPECT_EQ(info.String(L"FileDescription"), L"Python REPL server");
    EXPECT_EQ(info.String(L"FileVersion"), L"1.0.0.5");
    EXPECT_EQ(info.String(L"ProductVersion"), L"0.0.0.0");
}

// An assembly element and nothing in it (after an optional XML declaration).
TEST_P(Resources, ManifestIsAnEmptyAssembly)
{
    std::vector<WORD> vecIds = Names(RT_MANIFEST);
    ASSERT_EQ(vecIds.size(), 1u) << "exactly one manifest";
    std::string strManifest = Bytes(RT_MANIFEST, MAKEINTRESOURCEW(vecIds[0]));
    ASSERT_FALSE(strManifest.empty());
    size_t nStart = strManifest.find("<assembly ");
    ASSERT_NE(nStart, std::string::npos);
    std::string strProlog = strManifest.substr(0, nStart);
    if (strProlog.rfind("<?xml", 0) == 0) strProlog.erase(0, strProlog.find("?>") + 2);
    EXPECT_EQ(strProlog.find_first_not_of(" \t\r\n"), std::string::npos) << "before the assembly: " << strProlog;
    size_t nOpenEnd = strManifest.find('>', nStart);
    ASSERT_NE(nOpenEnd, std::string::npos);
    std::string strOpen = strManifest.substr(nStart, nOpenEnd - nStart + 1);
    EXPECT_NE(strOpen.find("xmlns=\"urn:schemas-microsoft-com:asm.v1\""), std::string::npos) << strOpen;
    EXPECT_NE(strOpen.find("manifestVersion=\"1.0\""), std::string::npos) << strOpen;
    size_t nClose = strManifest.find("</assembly>", nOpenEnd);
    ASSERT_NE(nClose, std::string::npos);
    std::string strInside = strManifest.substr(nOpenEnd + 1, nClose - nOpenEnd - 1);
    EXPECT_EQ(strInside.find_first_not_of(" \t\r\n"), std::string::npos) << "content: " << strInside;
    EXPECT_EQ(strManifest.find_first_not_of(" \t\r\n", nClose + 11), std::string::npos);
}

INSTANTIATE_TEST_SUITE_P(BuiltDll, Resources, ::testing::ValuesIn(DllsUnderTest()),
                         [](const ::testing::TestParamInfo<DllUnderTest>& info) { return info.param.strArch; });

}  // namespace
