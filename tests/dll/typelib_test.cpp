// The automation contract as a client sees it: the type library read back
// from each built DLL's own file, attribute by attribute, and the values
// the compiled library stores where oleaut32 shows them rewritten.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "DllUnderTest.h"
#include "MsftFile.h"
#include "ReplServer_h.h"
#include "common/Raii.h"

namespace {

constexpr WORD kInterfaceFlags = TYPEFLAG_FDUAL | TYPEFLAG_FNONEXTENSIBLE | TYPEFLAG_FOLEAUTOMATION |
                                 TYPEFLAG_FDISPATCHABLE;  // 0x11C0
constexpr int kDispatchSlots = 7;  // IUnknown and IDispatch come first in the vtable
constexpr USHORT kIn = PARAMFLAG_FIN;
constexpr USHORT kOutRetval = PARAMFLAG_FOUT | PARAMFLAG_FRETVAL;
// stdole2.tlb, the OLE Automation library that IDispatch comes from.
constexpr GUID kLibidStdOle = {0x00020430, 0x0000, 0x0000, {0xC0, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x46}};

struct ExpectedParam
{
    const wchar_t* pszName;
    VARTYPE vt;
    VARTYPE vtPointee;  // for VT_PTR
    USHORT wFlags;
};

struct ExpectedMethod
{
    MEMBERID memid;
    const wchar_t* pszName;
    const wchar_t* pszHelp;
    std::vector<ExpectedParam> vecParams;
};

struct ExpectedInterface
{
    const IID* piid;
    const wchar_t* pszName;
    const wchar_t* pszHelp;
    std::vector<ExpectedMethod> vecMethods;
};

const ExpectedInterface g_IReplClient = {
    &IID_IReplClient, L"IReplClient", L"IReplClient Interface",
    {
        {1, L"Connect", L"Connect to REPL server", {{L"pServer", VT_DISPATCH, VT_EMPTY, kIn}}},
        {2, L"Print", L"Print standard output or error text",
         {{L"Text", VT_BSTR, VT_EMPTY, kIn}, {L"bIsError", VT_BOOL, VT_EMPTY, kIn}}},
        {3, L"GetUserInput", L"Get input from user",
         {{L"Prompt", VT_BSTR, VT_EMPTY, kIn}, {L"pRes", VT_PTR, VT_BSTR, kOutRetval}}},
        {4, L"Detach", L"Detach from REPL server", {}},
    }};

const ExpectedInterface g_IReplServer = {
    &IID_IReplServer, L"IReplServer", L"IReplServer Interface",
    {
        {1, L"Exec", L"Execute REPL command",
         {{L"Command", VT_BSTR, VT_EMPTY, kIn}, {L"Argument", VT_BSTR, VT_EMPTY, kIn},
          {L"pResult", VT_PTR, VT_BSTR, kOutRetval}}},
        {2, L"ExecCom", L"Execute REPL command",
         {{L"Command", VT_BSTR, VT_EMPTY, kIn}, {L"Argument", VT_VARIANT, VT_EMPTY, kIn},
          {L"pResult", VT_PTR, VT_VARIANT, kOutRetval}}},
        {3, L"Quit", L"Quit REPL server", {}},
    }};

// Owners of the descriptions oleaut32 hands out.
class CLibAttr
{
public:
    explicit CLibAttr(ITypeLib* pLib) : m_pLib(pLib) { m_hr = pLib->GetLibAttr(&m_pAttr); }
    ~CLibAttr() { if (m_pAttr) m_pLib->ReleaseTLibAttr(m_pAttr); }
    CLibAttr(const CLibAttr&) = delete;
    CLibAttr& operator=(const CLibAttr&) = delete;
    HRESULT Result() const { return m_hr; }
    const TLIBATTR* operator->() const { return m_pAttr; }

private:
    ITypeLib* m_pLib;
    TLIBATTR* m_pAttr = nullptr;
    HRESULT m_hr;
};

class CTypeAttr
{
public:
    explicit CTypeAttr(ITypeInfo* pInfo) : m_pInfo(pInfo) { m_hr = pInfo->GetTypeAttr(&m_pAttr); }
    ~CTypeAttr() { if (m_pAttr) m_pInfo->ReleaseTypeAttr(m_pAttr); }
    CTypeAttr(const CTypeAttr&) = delete;
    CTypeAttr& operator=(const CTypeAttr&) = delete;
    HRESULT Result() const { return m_hr; }
    const TYPEATTR* operator->() const { return m_pAttr; }

private:
    ITypeInfo* m_pInfo;
    TYPEATTR* m_pAttr = nullptr;
    HRESULT m_hr;
};

class CFuncDesc
{
public:
    CFuncDesc(ITypeInfo* pInfo, UINT nIndex) : m_pInfo(pInfo) { m_hr = pInfo->GetFuncDesc(nIndex, &m_pDesc); }
    ~CFuncDesc() { if (m_pDesc) m_pInfo->ReleaseFuncDesc(m_pDesc); }
    CFuncDesc(const CFuncDesc&) = delete;
    CFuncDesc& operator=(const CFuncDesc&) = delete;
    HRESULT Result() const { return m_hr; }
    const FUNCDESC* operator->() const { return m_pDesc; }

private:
    ITypeInfo* m_pInfo;
    FUNCDESC* m_pDesc = nullptr;
    HRESULT m_hr;
};

std::wstring Str(BSTR bstr)
{
    return bstr ? std::wstring(bstr, ::SysStringLen(bstr)) : std::wstring();
}

struct Documentation
{
    HRESULT hr;
    std::wstring strName;
    bool bHasHelp;
    std::wstring strHelp;
    DWORD dwHelpContext;
    bool bHasHelpFile;
};

template <class T>
Documentation DocumentationOf(T* p, MEMBERID memid)
{
    CComBSTR bstrName, bstrHelp, bstrFile;
    DWORD dwContext = 0xFFFFFFFF;
    HRESULT hr = p->GetDocumentation(memid, &bstrName, &bstrHelp, &dwContext, &bstrFile);
    return {hr, Str(bstrName), bstrHelp.Get() != nullptr, Str(bstrHelp), dwContext, bstrFile.Get() != nullptr};
}

std::vector<std::wstring> NamesOf(ITypeInfo* pInfo, MEMBERID memid)
{
    BSTR rgbstr[16] = {};
    UINT cNames = 0;
    std::vector<std::wstring> vecNames;
    if (FAILED(pInfo->GetNames(memid, rgbstr, 16, &cNames))) return vecNames;
    for (UINT i = 0; i < cNames; ++i) {
        vecNames.push_back(Str(rgbstr[i]));
        ::SysFreeString(rgbstr[i]);
    }
    return vecNames;
}

CComPtr<ITypeInfo> InterfaceHalf(ITypeInfo* pDispatch)
{
    CComPtr<ITypeInfo> spHalf;
    HREFTYPE hRef = 0;
    if (SUCCEEDED(pDispatch->GetRefTypeOfImplType(static_cast<UINT>(-1), &hRef))) {
        pDispatch->GetRefTypeInfo(hRef, &spHalf);
    }
    return spHalf;
}

class TypeLibrary : public ::testing::TestWithParam<DllUnderTest>
{
protected:
    void SetUp() override
    {
        const DllUnderTest& dll = GetParam();
        HRESULT hr = ::LoadTypeLibEx(dll.strPath.c_str(), REGKIND_NONE, &m_spLib);
        ASSERT_EQ(hr, S_OK) << "cannot load the type library of the " << dll.strArch << " DLL";
        LoadStoredLibrary(dll.strPath);
    }

    // The library as the compiler stored it in resource TYPELIB 1.
    void LoadStoredLibrary(const std::wstring& strPath)
    {
        CDataModule module(strPath);
        ASSERT_NE(module.Get(), nullptr);
        HRSRC hRes = ::FindResourceW(module.Get(), MAKEINTRESOURCEW(1), L"TYPELIB");
        ASSERT_NE(hRes, nullptr);
        HGLOBAL hData = ::LoadResource(module.Get(), hRes);
        ASSERT_NE(hData, nullptr);
        std::string strError;
        ASSERT_TRUE(ParseMsft(static_cast<const BYTE*>(::LockResource(hData)), ::SizeofResource(module.Get(), hRes),
                              m_stored, strError))
            << strError;
    }

    CComPtr<ITypeInfo> TypeInfoAt(UINT nIndex)
    {
        CComPtr<ITypeInfo> spInfo;
        EXPECT_EQ(m_spLib->GetTypeInfo(nIndex, &spInfo), S_OK);
        return spInfo;
    }

    size_t SlotSize() const { return GetParam().cbPointer; }

    void ExpectInterface(UINT nIndex, const ExpectedInterface& expected);
    void ExpectMethod(ITypeInfo* pHalf, UINT nIndex, const ExpectedMethod& expected);
    void ExpectCoclass(UINT nIndex, const CLSID& clsid, const wchar_t* pszName, const wchar_t* pszHelp,
                       const IID& iidDefault);

    CComPtr<ITypeLib> m_spLib;
    MsftLibrary m_stored{};
};

// The generated constants the other checks compare with, against the
// contract's published values.
TEST(ContractIdentifiers, HaveThePublishedGuids)
{
    constexpr GUID kLibid = {0x0CB9E5FD, 0x9B0B, 0x4B91, {0x94, 0xA8, 0x5C, 0x79, 0x5C, 0xE0, 0xAA, 0x4F}};
    constexpr GUID kIidClient = {0xE2A5B22E, 0x5CC6, 0x47D9, {0xA1, 0xE3, 0x87, 0x96, 0x60, 0x3A, 0x0A, 0x27}};
    constexpr GUID kIidServer = {0x4208EC1C, 0xDC31, 0x4575, {0xA2, 0x43, 0x97, 0x5C, 0x64, 0xCA, 0xAC, 0x4E}};
    constexpr GUID kClsidClient = {0x30CD17AD, 0xB9A0, 0x422D, {0xB0, 0xAA, 0xF5, 0xDE, 0x11, 0xD3, 0x28, 0x29}};
    constexpr GUID kClsidServer = {0x02AE35D8, 0x1B9F, 0x412F, {0x88, 0x37, 0x34, 0x9B, 0xB1, 0x00, 0x85, 0x10}};
    EXPECT_TRUE(::IsEqualGUID(LIBID_ReplServerLib, kLibid));
    EXPECT_TRUE(::IsEqualGUID(IID_IReplClient, kIidClient));
    EXPECT_TRUE(::IsEqualGUID(IID_IReplServer, kIidServer));
    EXPECT_TRUE(::IsEqualGUID(CLSID_ReplClient, kClsidClient));
    EXPECT_TRUE(::IsEqualGUID(CLSID_ReplServer, kClsidServer));
}

TEST_P(TypeLibrary, LibraryAttributesAreTheContractsOnes)
{
    CLibAttr attr(m_spLib);
    ASSERT_EQ(attr.Result(), S_OK);
    EXPECT_TRUE(::IsEqualGUID(attr->guid, LIBID_ReplServerLib));
    EXPECT_EQ(attr->lcid, 0u);
    EXPECT_EQ(attr->syskind, GetParam().sysKind);
    EXPECT_EQ(attr->wMajorVerNum, 1);
    EXPECT_EQ(attr->wMinorVerNum, 0);
    // oleaut32 adds "has a disk image" to every library it loads from a file.
    EXPECT_EQ(attr->wLibFlags & ~LIBFLAG_FHASDISKIMAGE, 0);
    EXPECT_EQ(m_stored.nFlags, 0u);
    EXPECT_EQ(m_stored.nSysKind, GetParam().sysKind);
    EXPECT_EQ(m_stored.wMajor, 1);
    EXPECT_EQ(m_stored.wMinor, 0);
}

TEST_P(TypeLibrary, LibraryIsNamedAndHasNoHelp)
{
    Documentation doc = DocumentationOf(m_spLib.Get(), MEMBERID_NIL);
    ASSERT_EQ(doc.hr, S_OK);
    EXPECT_EQ(doc.strName, L"ReplServerLib");
    EXPECT_FALSE(doc.bHasHelp);
    EXPECT_EQ(doc.dwHelpContext, 0u);
    EXPECT_FALSE(doc.bHasHelpFile);
}

TEST_P(TypeLibrary, HoldsFourTypesInContractOrder)
{
    ASSERT_EQ(m_spLib->GetTypeInfoCount(), 4u);
    const wchar_t* rgpszNames[] = {L"IReplClient", L"IReplServer", L"ReplClient", L"ReplServer"};
    const GUID* rgpGuids[] = {&IID_IReplClient, &IID_IReplServer, &CLSID_ReplClient, &CLSID_ReplServer};
    const TYPEKIND rgKinds[] = {TKIND_DISPATCH, TKIND_DISPATCH, TKIND_COCLASS, TKIND_COCLASS};
    for (UINT i = 0; i < 4; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(DocumentationOf(m_spLib.Get(), i).strName, rgpszNames[i]);
        TYPEKIND kind = TKIND_MAX;
        EXPECT_EQ(m_spLib->GetTypeInfoType(i, &kind), S_OK);
        EXPECT_EQ(kind, rgKinds[i]);
        CComPtr<ITypeInfo> spInfo = TypeInfoAt(i);
        ASSERT_NE(spInfo.Get(), nullptr);
        CTypeAttr attr(spInfo);
        ASSERT_EQ(attr.Result(), S_OK);
        EXPECT_TRUE(::IsEqualGUID(attr->guid, *rgpGuids[i]));
        CComPtr<ITypeInfo> spByGuid;
        EXPECT_EQ(m_spLib->GetTypeInfoOfGuid(*rgpGuids[i], &spByGuid), S_OK);
        EXPECT_EQ(m_stored.vecTypes.at(i).nTypeKind, rgKinds[i]);
    }
}

void TypeLibrary::ExpectInterface(UINT nIndex, const ExpectedInterface& expected)
{
    Documentation doc = DocumentationOf(m_spLib.Get(), nIndex);
    EXPECT_EQ(doc.strName, expected.pszName);
    EXPECT_EQ(doc.strHelp, expected.pszHelp);
    EXPECT_EQ(doc.dwHelpContext, 0u);

    // The dispatch view: oleaut32 reports TYPEFLAG_FOLEAUTOMATION only on
    // the interface half of a dual interface (on Windows as well).
    CComPtr<ITypeInfo> spDispatch = TypeInfoAt(nIndex);
    ASSERT_NE(spDispatch.Get(), nullptr);
    CTypeAttr attrDispatch(spDispatch);
    ASSERT_EQ(attrDispatch.Result(), S_OK);
    EXPECT_EQ(attrDispatch->wTypeFlags, kInterfaceFlags & ~TYPEFLAG_FOLEAUTOMATION);
    EXPECT_EQ(attrDispatch->cFuncs, kDispatchSlots + expected.vecMethods.size());

    CComPtr<ITypeInfo> spHalf = InterfaceHalf(spDispatch);
    ASSERT_NE(spHalf.Get(), nullptr);
    CTypeAttr attr(spHalf);
    ASSERT_EQ(attr.Result(), S_OK);
    EXPECT_EQ(attr->typekind, TKIND_INTERFACE);
    EXPECT_TRUE(::IsEqualGUID(attr->guid, *expected.piid));
    EXPECT_EQ(attr->wTypeFlags, kInterfaceFlags);
    EXPECT_EQ(attr->wMajorVerNum, 0);
    EXPECT_EQ(attr->wMinorVerNum, 0);
    EXPECT_EQ(attr->cImplTypes, 1);
    ASSERT_EQ(attr->cFuncs, expected.vecMethods.size());
    for (UINT i = 0; i < expected.vecMethods.size(); ++i) {
        SCOPED_TRACE(expected.vecMethods[i].pszName);
        ExpectMethod(spHalf, i, expected.vecMethods[i]);
    }

    // What the compiler stored: one dual record with the full flags, and
    // the vtable in slots of this library's own system kind.
    const MsftType& stored = m_stored.vecTypes.at(nIndex);
    EXPECT_EQ(stored.nFlags, kInterfaceFlags);
    EXPECT_EQ(static_cast<size_t>(stored.cbSizeVft), (kDispatchSlots + expected.vecMethods.size()) * SlotSize());
    ASSERT_EQ(stored.vecFuncs.size(), expected.vecMethods.size());
    for (size_t i = 0; i < stored.vecFuncs.size(); ++i) {
        EXPECT_EQ(static_cast<size_t>(stored.vecFuncs[i].nVtableOffset), (kDispatchSlots + i) * SlotSize());
        EXPECT_EQ(stored.vecFuncs[i].nFuncKind, FUNC_PUREVIRTUAL);
        EXPECT_EQ(stored.vecFuncs[i].nInvokeKind, INVOKE_FUNC);
        EXPECT_EQ(stored.vecFuncs[i].nCallConv, CC_STDCALL);
    }
}

void TypeLibrary::ExpectMethod(ITypeInfo* pHalf, UINT nIndex, const ExpectedMethod& expected)
{
    CFuncDesc desc(pHalf, nIndex);
    ASSERT_EQ(desc.Result(), S_OK);
    EXPECT_EQ(desc->memid, expected.memid);
    EXPECT_EQ(desc->funckind, FUNC_PUREVIRTUAL);
    EXPECT_EQ(desc->invkind, INVOKE_FUNC);
    EXPECT_EQ(desc->callconv, CC_STDCALL);
    EXPECT_EQ(desc->elemdescFunc.tdesc.vt, VT_HRESULT);
    EXPECT_EQ(desc->cParamsOpt, 0);
    EXPECT_EQ(desc->wFuncFlags, 0);
    // As a caller of this process sees the vtable (oleaut32 rescales a
    // 32-bit library's slots for a 64-bit reader; the stored ones are
    // checked against the library's own system kind).
    EXPECT_EQ(static_cast<size_t>(desc->oVft), (kDispatchSlots + nIndex) * sizeof(void*));
    ASSERT_EQ(static_cast<size_t>(desc->cParams), expected.vecParams.size());
    for (size_t i = 0; i < expected.vecParams.size(); ++i) {
        const ELEMDESC& elem = desc->lprgelemdescParam[i];
        const ExpectedParam& param = expected.vecParams[i];
        EXPECT_EQ(elem.tdesc.vt, param.vt) << "parameter " << i;
        if (param.vt == VT_PTR) {
            EXPECT_EQ(elem.tdesc.lptdesc->vt, param.vtPointee) << "parameter " << i;
        }
        EXPECT_EQ(elem.paramdesc.wParamFlags, param.wFlags) << "parameter " << i;
    }

    std::vector<std::wstring> vecNames{expected.pszName};
    for (const ExpectedParam& param : expected.vecParams) vecNames.push_back(param.pszName);
    EXPECT_EQ(NamesOf(pHalf, expected.memid), vecNames);

    Documentation doc = DocumentationOf(pHalf, expected.memid);
    ASSERT_EQ(doc.hr, S_OK);
    EXPECT_EQ(doc.strName, expected.pszName);
    EXPECT_EQ(doc.strHelp, expected.pszHelp);
    EXPECT_EQ(doc.dwHelpContext, 0u);
}

TEST_P(TypeLibrary, IReplClientIsTheContractsDualInterface)
{
    ExpectInterface(0, g_IReplClient);
}

TEST_P(TypeLibrary, IReplServerIsTheContractsDualInterface)
{
    ExpectInterface(1, g_IReplServer);
}

// Late-bound clients resolve names on the dispatch view.
TEST_P(TypeLibrary, DispatchViewsResolveMethodNamesToTheirIds)
{
    const ExpectedInterface* rgpInterfaces[] = {&g_IReplClient, &g_IReplServer};
    for (UINT nIndex = 0; nIndex < 2; ++nIndex) {
        CComPtr<ITypeInfo> spDispatch = TypeInfoAt(nIndex);
        ASSERT_NE(spDispatch.Get(), nullptr);
        for (const ExpectedMethod& method : rgpInterfaces[nIndex]->vecMethods) {
            LPOLESTR pszName = const_cast<LPOLESTR>(method.pszName);
            MEMBERID memid = MEMBERID_NIL;
            EXPECT_EQ(spDispatch->GetIDsOfNames(&pszName, 1, &memid), S_OK) << method.pszName;
            EXPECT_EQ(memid, method.memid) << method.pszName;
        }
    }
}

TEST_P(TypeLibrary, InterfacesDeriveFromIDispatchOfStdOle2)
{
    for (UINT nIndex = 0; nIndex < 2; ++nIndex) {
        CComPtr<ITypeInfo> spHalf = InterfaceHalf(TypeInfoAt(nIndex));
        ASSERT_NE(spHalf.Get(), nullptr);
        HREFTYPE hRef = 0;
        ASSERT_EQ(spHalf->GetRefTypeOfImplType(0, &hRef), S_OK);
        CComPtr<ITypeInfo> spBase;
        ASSERT_EQ(spHalf->GetRefTypeInfo(hRef, &spBase), S_OK);
        CTypeAttr attr(spBase);
        ASSERT_EQ(attr.Result(), S_OK);
        EXPECT_TRUE(::IsEqualGUID(attr->guid, IID_IDispatch));
        CComPtr<ITypeLib> spBaseLib;
        UINT nBaseIndex = 0;
        ASSERT_EQ(spBase->GetContainingTypeLib(&spBaseLib, &nBaseIndex), S_OK);
        CLibAttr libAttr(spBaseLib);
        ASSERT_EQ(libAttr.Result(), S_OK);
        EXPECT_TRUE(::IsEqualGUID(libAttr->guid, kLibidStdOle));
        EXPECT_EQ(libAttr->wMajorVerNum, 2);
        EXPECT_EQ(libAttr->wMinorVerNum, 0);
    }
}

void TypeLibrary::ExpectCoclass(UINT nIndex, const CLSID& clsid, const wchar_t* pszName, const wchar_t* pszHelp,
                                const IID& iidDefault)
{
    Documentation doc = DocumentationOf(m_spLib.Get(), nIndex);
    EXPECT_EQ(doc.strName, pszName);
    EXPECT_EQ(doc.strHelp, pszHelp);
    EXPECT_EQ(doc.dwHelpContext, 0u);
    CComPtr<ITypeInfo> spInfo = TypeInfoAt(nIndex);
    ASSERT_NE(spInfo.Get(), nullptr);
    CTypeAttr attr(spInfo);
    ASSERT_EQ(attr.Result(), S_OK);
    EXPECT_TRUE(::IsEqualGUID(attr->guid, clsid));
    EXPECT_EQ(attr->wTypeFlags, 0) << "a coclass of the contract is never creatable";
    EXPECT_EQ(m_stored.vecTypes.at(nIndex).nFlags, 0u);
    ASSERT_EQ(attr->cImplTypes, 1);
    INT nImplFlags = 0;
    EXPECT_EQ(spInfo->GetImplTypeFlags(0, &nImplFlags), S_OK);
    EXPECT_EQ(nImplFlags, IMPLTYPEFLAG_FDEFAULT);
    HREFTYPE hRef = 0;
    ASSERT_EQ(spInfo->GetRefTypeOfImplType(0, &hRef), S_OK);
    CComPtr<ITypeInfo> spDefault;
    ASSERT_EQ(spInfo->GetRefTypeInfo(hRef, &spDefault), S_OK);
    CTypeAttr attrDefault(spDefault);
    ASSERT_EQ(attrDefault.Result(), S_OK);
    EXPECT_TRUE(::IsEqualGUID(attrDefault->guid, iidDefault));
}

TEST_P(TypeLibrary, ReplClientIsANonCreatableCoclass)
{
    ExpectCoclass(2, CLSID_ReplClient, L"ReplClient", L"ReplClient Class", IID_IReplClient);
}

TEST_P(TypeLibrary, ReplServerIsANonCreatableCoclass)
{
    ExpectCoclass(3, CLSID_ReplServer, L"ReplServer", L"ReplServer Class", IID_IReplServer);
}

INSTANTIATE_TEST_SUITE_P(BuiltDll, TypeLibrary, ::testing::ValuesIn(DllsUnderTest()),
                         [](const ::testing::TestParamInfo<DllUnderTest>& info) { return info.param.strArch; });

}  // namespace
