// Tests of the client library's parts: the client object, the client text,
// the pipe, the pumping waits, the server call helpers, the host process
// (stdio, debug output, attach), and a whole session against a small
// stand-in server in another process.
#include <process.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstring>
#include <map>
#include <set>

#include "TestHelpers.h"
#include "client/ReplClient.h"

namespace {

// ---- helpers -----------------------------------------------------------------------

VARIANT BstrArg(BSTR bstr)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BSTR;
    V_BSTR(&var) = bstr;
    return var;
}

VARIANT BoolArg(VARIANT_BOOL b)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_BOOL;
    V_BOOL(&var) = b;
    return var;
}

VARIANT DispatchArg(IDispatch* p)
{
    VARIANT var;
    ::VariantInit(&var);
    V_VT(&var) = VT_DISPATCH;
    V_DISPATCH(&var) = p;
    return var;
}

HRESULT InvokePrint(IDispatch* pClient, const wchar_t* pszText, VARIANT_BOOL bIsError)
{
    CComBSTR bstrText(pszText);
    return InvokeById(pClient, CReplClientObject::DISPID_PRINT, {BstrArg(bstrText), BoolArg(bIsError)}).hr;
}

CallResult InvokeInput(IDispatch* pClient, const wchar_t* pszPrompt)
{
    CComBSTR bstrPrompt(pszPrompt);
    return InvokeById(pClient, CReplClientObject::DISPID_GETUSERINPUT, {BstrArg(bstrPrompt)});
}

HRESULT InvokeConnect(IDispatch* pClient, IDispatch* pServer)
{
    return InvokeById(pClient, CReplClientObject::DISPID_CONNECT, {DispatchArg(pServer)}).hr;
}

bool IsSignaled(HANDLE h)
{
    return ::WaitForSingleObject(h, 0) == WAIT_OBJECT_0;
}

// ---- Base64 ------------------------------------------------------------------------

TEST(Base64, EncodesTheStandardVectors)
{
    const std::pair<const char*, const char*> kVectors[] = {
        {"", ""},         {"f", "Zg=="},         {"fo", "Zm8="},         {"foo", "Zm9v"},
        {"foob", "Zm9vYg=="}, {"fooba", "Zm9vYmE="}, {"foobar", "Zm9vYmFy"}, {"\xff\xfe\xfd", "//79"},
    };
    for (const auto& vector : kVectors) {
        EXPECT_EQ(Base64Encode(vector.first, std::strlen(vector.first)), vector.second) << vector.first;
    }
}

TEST(Base64, RoundTripsEveryLengthUpToSomeHundreds)
{
    std::vector<BYTE> vecData;
    unsigned nSeed = 12345;
    for (size_t cb = 0; cb < 300; ++cb) {
        std::string strText = Base64Encode(vecData.data(), vecData.size());
        EXPECT_EQ(strText.size(), (cb + 2) / 3 * 4);
        std::vector<BYTE> vecBack;
        ASSERT_TRUE(Base64DecodeStrict(strText, vecBack)) << cb;
        ASSERT_EQ(vecBack, vecData) << cb;
        nSeed = nSeed * 1103515245 + 12345;
        vecData.push_back(static_cast<BYTE>(nSeed >> 16));
    }
}

TEST(Base64, StrictDecoderRejectsMalformedTexts)
{
    std::vector<BYTE> vecOut;
    for (const char* pszBad : {"Zg=", "Z===", "Zh==", "Zm9v!A==", "Zm 9v", "=Zm9"}) {
        EXPECT_FALSE(Base64DecodeStrict(pszBad, vecOut)) << pszBad;
    }
}

// ---- the client object in process ----------------------------------------------------

TEST(ClientObject, NamesResolveToTheFourDispatchIdsIgnoringCase)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    const std::pair<const wchar_t*, DISPID> kNames[] = {
        {L"Connect", 1}, {L"print", 2}, {L"GETUSERINPUT", 3}, {L"Detach", 4}};
    for (const auto& name : kNames) {
        DISPID dispid = 0;
        EXPECT_HRESULT_SUCCEEDED(GetDispId(spClient, name.first, &dispid));
        EXPECT_EQ(dispid, name.second) << name.first;
    }
    DISPID dispid = 0;
    EXPECT_EQ(GetDispId(spClient, L"Exec", &dispid), DISP_E_UNKNOWNNAME);
    EXPECT_EQ(dispid, DISPID_UNKNOWN);
}

TEST(ClientObject, InvokeRejectsMalformedCalls)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    CComBSTR bstrText(L"x");
    EXPECT_EQ(InvokeById(spClient, CReplClientObject::DISPID_PRINT, {BstrArg(bstrText)}).hr, DISP_E_BADPARAMCOUNT);
    EXPECT_EQ(InvokeById(spClient, 9, {}).hr, DISP_E_MEMBERNOTFOUND);
    EXPECT_EQ(InvokeById(spClient, CReplClientObject::DISPID_DETACH, {BstrArg(bstrText)}).hr, DISP_E_BADPARAMCOUNT);
    DISPPARAMS params = {nullptr, nullptr, 0, 0};
    CComVariant varResult;
    EXPECT_EQ(spClient->Invoke(4, IID_NULL, 0, DISPATCH_PROPERTYPUT, &params, &varResult, nullptr, nullptr),
              DISP_E_MEMBERNOTFOUND);
    EXPECT_TRUE(spClient->Calls().empty());
    EXPECT_FALSE(IsSignaled(spClient->DetachedEvent()));
}

TEST(ClientObject, PrintRecordsTextKindAndThreadInOrder)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    std::vector<std::pair<std::wstring, bool>> vecSeen;
    spClient->SetPrintHandler([&](const std::wstring& str, bool bErr) { vecSeen.emplace_back(str, bErr); });
    EXPECT_HRESULT_SUCCEEDED(InvokePrint(spClient, L"out 1\n", VARIANT_FALSE));
    EXPECT_HRESULT_SUCCEEDED(InvokePrint(spClient, L"err\n", VARIANT_TRUE));
    EXPECT_HRESULT_SUCCEEDED(InvokePrint(spClient, L"out 2\n", VARIANT_FALSE));

    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), 3u);
    EXPECT_EQ(vecCalls[1].strText, L"err\n");
    EXPECT_TRUE(vecCalls[1].bIsError);
    EXPECT_EQ(vecCalls[1].nIsError, VARIANT_TRUE);
    EXPECT_FALSE(vecCalls[2].bIsError);
    EXPECT_EQ(vecCalls[0].dwThreadId, ::GetCurrentThreadId());
    EXPECT_EQ(vecCalls[0].wFlags, DISPATCH_METHOD);
    EXPECT_EQ(vecCalls[0].cArgs, 2u);
    EXPECT_EQ(spClient->Output(false), L"out 1\nout 2\n");
    EXPECT_EQ(spClient->Output(true), L"err\n");
    ASSERT_EQ(vecSeen.size(), 3u);
    EXPECT_EQ(vecSeen[1], std::make_pair(std::wstring(L"err\n"), true));
}

TEST(ClientObject, PrintFailsFromTheChosenCallOn)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    int nHandled = 0;
    spClient->SetPrintHandler([&](const std::wstring&, bool) { ++nHandled; });
    spClient->SetResult(CReplClientObject::DISPID_PRINT, E_ACCESSDENIED, 3);
    std::vector<HRESULT> vecResults;
    for (int i = 0; i < 4; ++i) vecResults.push_back(InvokePrint(spClient, L"x", VARIANT_FALSE));
    EXPECT_EQ(vecResults, (std::vector<HRESULT>{S_OK, S_OK, E_ACCESSDENIED, E_ACCESSDENIED}));
    EXPECT_EQ(nHandled, 2);
    EXPECT_EQ(spClient->Output(false), L"xx");
    EXPECT_EQ(spClient->Calls()[3].hrAnswer, E_ACCESSDENIED);
    spClient->SetResult(CReplClientObject::DISPID_PRINT, S_OK);
    EXPECT_EQ(InvokePrint(spClient, L"y", VARIANT_FALSE), S_OK);
}

TEST(ClientObject, InputAnswersComeFromTheQueueThenTheDefault)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    VARIANT varFive;
    ::VariantInit(&varFive);
    V_VT(&varFive) = VT_I4;
    V_I4(&varFive) = 5;
    spClient->QueueInput(CInputAnswer::Text(L"one"));
    spClient->QueueInput(CInputAnswer::NoInput());
    spClient->QueueInput(CInputAnswer::Failure(E_ACCESSDENIED));
    spClient->QueueInput(CInputAnswer::Value(varFive));
    spClient->QueueInput(CInputAnswer::Text(L""));
    spClient->SetDefaultInput(CInputAnswer::Text(L"default"));

    CallResult first = InvokeInput(spClient, L"p1> ");
    EXPECT_EQ(first.hr, S_OK);
    EXPECT_EQ(V_VT(&first.varResult), VT_BSTR);
    EXPECT_EQ(first.Text(), L"one");
    CallResult second = InvokeInput(spClient, L"p2> ");
    EXPECT_EQ(second.hr, S_OK);
    EXPECT_EQ(V_VT(&second.varResult), VT_EMPTY);
    EXPECT_EQ(InvokeInput(spClient, L"p3> ").hr, E_ACCESSDENIED);
    CallResult fourth = InvokeInput(spClient, L"p4> ");
    EXPECT_EQ(V_VT(&fourth.varResult), VT_I4);
    EXPECT_EQ(V_I4(&fourth.varResult), 5);
    CallResult fifth = InvokeInput(spClient, L"p5> ");
    ASSERT_EQ(V_VT(&fifth.varResult), VT_BSTR);
    EXPECT_NE(V_BSTR(&fifth.varResult), nullptr);  // empty input is still input
    EXPECT_EQ(InvokeInput(spClient, nullptr).Text(), L"default");

    auto vecCalls = spClient->CallsOf(CReplClientObject::DISPID_GETUSERINPUT);
    ASSERT_EQ(vecCalls.size(), 6u);
    EXPECT_EQ(vecCalls[0].strText, L"p1> ");
    EXPECT_EQ(vecCalls[0].strAnswer, L"one");
    EXPECT_EQ(vecCalls[2].hrAnswer, E_ACCESSDENIED);
    EXPECT_TRUE(vecCalls[5].bNullText);
    EXPECT_FALSE(vecCalls[4].bNullText);
}

TEST(ClientObject, InputHandlerAnswersWhenTheQueueIsEmpty)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    std::vector<std::wstring> vecPrompts;
    spClient->SetInputHandler([&](const std::wstring& strPrompt) {
        vecPrompts.push_back(strPrompt);
        return CInputAnswer::Text(L"typed " + std::to_wstring(vecPrompts.size()));
    });
    spClient->QueueInput(CInputAnswer::Text(L"queued"));
    EXPECT_EQ(InvokeInput(spClient, L"a").Text(), L"queued");
    EXPECT_EQ(InvokeInput(spClient, L"b").Text(), L"typed 1");
    EXPECT_EQ(vecPrompts, std::vector<std::wstring>{L"b"});
    BSTR bstrAnswer = nullptr;
    EXPECT_EQ(spClient->GetUserInput(nullptr, &bstrAnswer), S_OK);
    EXPECT_STREQ(bstrAnswer, L"typed 2");
    ::SysFreeString(bstrAnswer);
}

TEST(ClientObject, ConnectKeepsItsOwnServerReferenceUntilDetach)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    CComPtr<CReplClientObject> spServer = CReplClientObject::Create();  // any IDispatch will do
    ULONG nBefore = spServer->RefCount();
    EXPECT_HRESULT_SUCCEEDED(InvokeConnect(spClient, spServer));
    EXPECT_EQ(spServer->RefCount(), nBefore + 1);
    EXPECT_TRUE(IsSignaled(spClient->ConnectedEvent()));
    EXPECT_TRUE(spClient->IsConnected());
    EXPECT_EQ(spClient->Server().Get(), static_cast<IDispatch*>(spServer.Get()));

    EXPECT_HRESULT_SUCCEEDED(InvokeById(spClient, CReplClientObject::DISPID_DETACH, {}).hr);
    EXPECT_EQ(spServer->RefCount(), nBefore);
    EXPECT_FALSE(spClient->IsConnected());
    EXPECT_TRUE(spClient->WasDetached());
    EXPECT_TRUE(IsSignaled(spClient->DetachedEvent()));
    EXPECT_EQ(spClient->Server().Get(), nullptr);
}

TEST(ClientObject, FailedConnectKeepsNoServerAndFailedDetachStillLetsGo)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    CComPtr<CReplClientObject> spServer = CReplClientObject::Create();
    ULONG nBefore = spServer->RefCount();
    spClient->SetResult(CReplClientObject::DISPID_CONNECT, E_FAIL);
    EXPECT_EQ(InvokeConnect(spClient, spServer), E_FAIL);
    EXPECT_EQ(spServer->RefCount(), nBefore);
    EXPECT_FALSE(IsSignaled(spClient->ConnectedEvent()));

    spClient->SetResult(CReplClientObject::DISPID_CONNECT, S_OK);
    spClient->SetResult(CReplClientObject::DISPID_DETACH, E_UNEXPECTED);
    EXPECT_EQ(InvokeConnect(spClient, spServer), S_OK);
    EXPECT_EQ(InvokeById(spClient, CReplClientObject::DISPID_DETACH, {}).hr, E_UNEXPECTED);
    EXPECT_EQ(spServer->RefCount(), nBefore);
    EXPECT_TRUE(spClient->WasDetached());
}

TEST(ClientObject, PrintCountEventIsSetAtTheNthPrint)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    HANDLE hThree = spClient->PrintCountEvent(3);
    InvokePrint(spClient, L"1", VARIANT_FALSE);
    InvokePrint(spClient, L"2", VARIANT_TRUE);
    EXPECT_FALSE(IsSignaled(hThree));
    InvokePrint(spClient, L"3", VARIANT_FALSE);
    EXPECT_TRUE(IsSignaled(hThree));
    EXPECT_TRUE(IsSignaled(spClient->PrintCountEvent(2)));  // already reached when asked
    EXPECT_FALSE(IsSignaled(spClient->PrintCountEvent(4)));
}

TEST(ClientObject, HookRunsInsideTheCallAndMayCallOutNested)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    CComPtr<CReplClientObject> spOther = CReplClientObject::Create();
    spClient->SetCallHook([&](const CReplClientObject::Call& call) -> std::optional<HRESULT> {
        if (call.dispid != CReplClientObject::DISPID_PRINT) return std::nullopt;
        if (call.strText == L"refuse") return E_ABORT;
        // A nested call made from inside the call, as a console does when
        // it calls the server while handling output.
        InvokePrint(spOther, (L"inner " + call.strText).c_str(), VARIANT_FALSE);
        InvokePrint(spClient, L"refuse", VARIANT_FALSE);
        return std::nullopt;
    });
    EXPECT_EQ(InvokePrint(spClient, L"outer", VARIANT_FALSE), S_OK);
    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), 2u);
    EXPECT_EQ(vecCalls[0].strText, L"outer");
    EXPECT_EQ(vecCalls[0].hrAnswer, S_OK);
    EXPECT_EQ(vecCalls[1].strText, L"refuse");
    EXPECT_EQ(vecCalls[1].hrAnswer, E_ABORT);
    EXPECT_EQ(spOther->Output(false), L"inner outer");
    EXPECT_EQ(spClient->Output(false), L"outer");
}

TEST(ClientObject, UnrecordedCallsAreStillCountedSignaledAndHandled)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    int nHandled = 0;
    spClient->SetPrintHandler([&](const std::wstring&, bool) { ++nHandled; });
    spClient->SetRecording(false);
    InvokePrint(spClient, L"1", VARIANT_FALSE);
    InvokePrint(spClient, L"2", VARIANT_FALSE);
    EXPECT_TRUE(spClient->Calls().empty());
    EXPECT_EQ(spClient->CallCount(), 2u);
    EXPECT_EQ(nHandled, 2);
    EXPECT_TRUE(IsSignaled(spClient->PrintCountEvent(2)));

    spClient->SetRecording(true);
    InvokePrint(spClient, L"3", VARIANT_FALSE);
    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), 1u);
    EXPECT_EQ(vecCalls[0].nSequence, 3u);
    EXPECT_EQ(vecCalls[0].strText, L"3");
}

TEST(ClientObject, ClearingTheRecordDuringACallIsSafe)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    InvokePrint(spClient, L"before", VARIANT_FALSE);
    spClient->SetCallHook([&](const CReplClientObject::Call&) -> std::optional<HRESULT> {
        spClient->ClearCalls();
        return E_ACCESSDENIED;
    });
    EXPECT_EQ(InvokePrint(spClient, L"during", VARIANT_FALSE), E_ACCESSDENIED);
    EXPECT_TRUE(spClient->Calls().empty());
    spClient->SetCallHook(nullptr);
    EXPECT_EQ(InvokePrint(spClient, L"after", VARIANT_FALSE), S_OK);
    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), 1u);
    EXPECT_EQ(vecCalls[0].strText, L"after");
    EXPECT_EQ(vecCalls[0].nSequence, 3u);
}

struct PrintBurst
{
    IDispatch* pClient;
    int nThread;
    int nPrints;
};

unsigned __stdcall PrintBurstProc(void* pvParam)
{
    const PrintBurst& burst = *static_cast<const PrintBurst*>(pvParam);
    for (int i = 0; i < burst.nPrints; ++i) {
        std::wstring strText = std::to_wstring(burst.nThread) + L":" + std::to_wstring(i);
        InvokePrint(burst.pClient, strText.c_str(), VARIANT_FALSE);
    }
    return 0;
}

TEST(ClientObject, PrintsFromManyThreadsAreAllRecordedInEachThreadsOrder)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    constexpr int kThreads = 8, kPrints = 200;
    std::vector<PrintBurst> vecBursts;
    for (int t = 0; t < kThreads; ++t) vecBursts.push_back({spClient, t, kPrints});
    std::vector<CHandle> vecThreads;
    for (auto& burst : vecBursts) {
        vecThreads.emplace_back(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, PrintBurstProc, &burst, 0, nullptr)));
    }
    for (auto& hThread : vecThreads) ASSERT_EQ(::WaitForSingleObject(hThread.Get(), kWaitMs), WAIT_OBJECT_0);
    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), static_cast<size_t>(kThreads * kPrints));
    std::map<int, int> mapNext;
    for (const auto& call : vecCalls) {
        int nThread = std::stoi(call.strText.substr(0, call.strText.find(L':')));
        int nIndex = std::stoi(call.strText.substr(call.strText.find(L':') + 1));
        EXPECT_EQ(nIndex, mapNext[nThread]++);
    }
    EXPECT_TRUE(IsSignaled(spClient->PrintCountEvent(kThreads * kPrints)));
}

TEST(ClientObject, ReferenceCountIsObservableAndAnswersItsInterfaces)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    EXPECT_EQ(spClient->RefCount(), 1u);
    CComPtr<IReplClient> spTyped;
    EXPECT_HRESULT_SUCCEEDED(spClient->QueryInterface(__uuidof(IReplClient), reinterpret_cast<void**>(&spTyped)));
    CComPtr<IDispatch> spDispatch;
    EXPECT_HRESULT_SUCCEEDED(spClient->QueryInterface(IID_IDispatch, reinterpret_cast<void**>(&spDispatch)));
    EXPECT_EQ(spClient->RefCount(), 3u);
    CComPtr<IUnknown> spOther;
    EXPECT_EQ(spClient->QueryInterface(IID_IStream, reinterpret_cast<void**>(&spOther)), E_NOINTERFACE);
    spTyped.Release();
    spDispatch.Release();
    EXPECT_EQ(spClient->RefCount(), 1u);
}

// ---- the client text across apartments ----------------------------------------------

struct RemoteCalls
{
    std::string strText;
    HRESULT hrUnmarshal = E_PENDING;
    HRESULT hrPrint = E_PENDING;
    HRESULT hrPrintRefused = E_PENDING;
    std::wstring strAnswer;
    HRESULT hrConnect = E_PENDING;
    HRESULT hrDetach = E_PENDING;
};

// The other side of the text: another apartment unmarshals it and calls the
// client as a server would.
unsigned __stdcall RemoteCallerProc(void* pvParam)
{
    RemoteCalls& calls = *static_cast<RemoteCalls*>(pvParam);
    ::CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    {
        CComPtr<IDispatch> spClient;
        calls.hrUnmarshal = UnmarshalFromBase64(calls.strText, &spClient);
        if (SUCCEEDED(calls.hrUnmarshal)) {
            CComPtr<CReplClientObject> spServer = CReplClientObject::Create();
            calls.hrConnect = InvokeConnect(spClient, spServer);
            calls.hrPrint = InvokePrint(spClient, L"remote\n", VARIANT_TRUE);
            calls.hrPrintRefused = InvokePrint(spClient, L"refused\n", VARIANT_FALSE);
            calls.strAnswer = InvokeInput(spClient, L"name? ").Text();
            calls.hrDetach = InvokeById(spClient, CReplClientObject::DISPID_DETACH, {}).hr;
        }
    }
    ::CoUninitialize();
    return 0;
}

class ClientText : public ComTest
{
};

TEST_F(ClientText, IsAMarshallingPacketThatAnotherApartmentCanCall)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    spClient->QueueInput(CInputAnswer::Text(L"Ada"));
    spClient->SetResult(CReplClientObject::DISPID_PRINT, E_ACCESSDENIED, 2);
    HRESULT hr = E_PENDING;
    RemoteCalls calls;
    calls.strText = MarshalToBase64(spClient, &hr);
    ASSERT_HRESULT_SUCCEEDED(hr);
    std::vector<BYTE> vecPacket;
    ASSERT_TRUE(Base64DecodeStrict(calls.strText, vecPacket));
    ASSERT_GE(vecPacket.size(), 4u);
    EXPECT_EQ(std::string(vecPacket.begin(), vecPacket.begin() + 4), "MEOW");

    CHandle hThread(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, RemoteCallerProc, &calls, 0, nullptr)));
    // The calls reach this apartment only while it pumps.
    ASSERT_TRUE(PumpWait(hThread.Get(), kWaitMs));
    EXPECT_HRESULT_SUCCEEDED(calls.hrUnmarshal);
    EXPECT_EQ(calls.hrConnect, S_OK);
    EXPECT_EQ(calls.hrPrint, S_OK);
    EXPECT_EQ(calls.hrPrintRefused, E_ACCESSDENIED);
    EXPECT_EQ(calls.strAnswer, L"Ada");
    EXPECT_EQ(calls.hrDetach, S_OK);
    auto vecCalls = spClient->Calls();
    ASSERT_EQ(vecCalls.size(), 5u);
    for (const auto& call : vecCalls) EXPECT_EQ(call.dwThreadId, ::GetCurrentThreadId());
    EXPECT_EQ(spClient->Output(true), L"remote\n");
    EXPECT_EQ(vecCalls[3].strText, L"name? ");
    EXPECT_TRUE(spClient->WasDetached());
    // The other apartment's references are all gone.
    EXPECT_TRUE(PumpUntil([&] { return spClient->RefCount() == 1; }, kWaitMs));
}

TEST_F(ClientText, NeverUnmarshalledTextGivesItsReferenceBack)
{
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    std::string strText = MarshalToBase64(spClient);
    ASSERT_FALSE(strText.empty());
    EXPECT_GT(spClient->RefCount(), 1u);
    EXPECT_HRESULT_SUCCEEDED(ReleaseMarshalText(strText));
    EXPECT_EQ(spClient->RefCount(), 1u);

    MarshalToBase64(spClient);
    EXPECT_GT(spClient->RefCount(), 1u);
    spClient->DisconnectRemotes();
    EXPECT_EQ(spClient->RefCount(), 1u);
}

TEST_F(ClientText, MarshallingNothingFails)
{
    HRESULT hr = S_OK;
    EXPECT_TRUE(MarshalToBase64(nullptr, &hr).empty());
    EXPECT_EQ(hr, E_POINTER);
    CComPtr<IDispatch> spDispatch;
    EXPECT_EQ(UnmarshalFromBase64("not base64!", &spDispatch), E_INVALIDARG);
}

// ---- waiting while pumping ----------------------------------------------------------

LONG g_nWindowMessages = 0;

LRESULT CALLBACK CountingWndProc(HWND hWnd, UINT uMsg, WPARAM wParam, LPARAM lParam)
{
    if (uMsg == WM_APP) ::InterlockedIncrement(&g_nWindowMessages);
    return ::DefWindowProcW(hWnd, uMsg, wParam, lParam);
}

// A message-only window whose messages count, as COM's hidden window does.
class CCountingWindow
{
public:
    CCountingWindow()
    {
        WNDCLASSW wc = {};
        wc.lpfnWndProc = CountingWndProc;
        wc.hInstance = ::GetModuleHandleW(nullptr);
        wc.lpszClassName = L"ReplClientTestCounting";
        ::RegisterClassW(&wc);
        m_hWnd = ::CreateWindowExW(0, wc.lpszClassName, L"", 0, 0, 0, 0, 0, HWND_MESSAGE, nullptr, wc.hInstance, nullptr);
    }
    ~CCountingWindow() { ::DestroyWindow(m_hWnd); }
    HWND Get() const { return m_hWnd; }

private:
    HWND m_hWnd;
};

unsigned __stdcall SetEventLaterProc(void* pvParam)
{
    ::Sleep(50);
    ::SetEvent(static_cast<HANDLE>(pvParam));
    return 0;
}

TEST(MessagePump, WaitsDispatchMessagesUntilTheHandleIsSignaled)
{
    CCountingWindow window;
    ASSERT_NE(window.Get(), nullptr);
    g_nWindowMessages = 0;
    CHandle hEvent(::CreateEventW(nullptr, TRUE, FALSE, nullptr));
    ::PostMessageW(window.Get(), WM_APP, 0, 0);
    EXPECT_FALSE(PumpWait(hEvent.Get(), 30));
    EXPECT_EQ(g_nWindowMessages, 1);

    ::PostMessageW(window.Get(), WM_APP, 0, 0);
    CHandle hThread(reinterpret_cast<HANDLE>(::_beginthreadex(nullptr, 0, SetEventLaterProc, hEvent.Get(), 0, nullptr)));
    EXPECT_TRUE(PumpWait(hEvent.Get(), kWaitMs));
    EXPECT_EQ(g_nWindowMessages, 2);
    ::WaitForSingleObject(hThread.Get(), kWaitMs);

    HANDLE hTwo[] = {window.Get() ? hThread.Get() : nullptr, hEvent.Get()};
    EXPECT_EQ(PumpWaitAny(hTwo, 2, kWaitMs), WAIT_OBJECT_0);
}

TEST(MessagePump, AQuitMessageMetOnTheWayIsKept)
{
    ::PostQuitMessage(5);
    PumpFor(20);
    MSG msg;
    ASSERT_TRUE(::PeekMessageW(&msg, nullptr, WM_QUIT, WM_QUIT, PM_REMOVE));
    EXPECT_EQ(msg.wParam, 5u);
}

TEST(MessagePump, PumpUntilEndsWhenTheConditionHolds)
{
    CCountingWindow window;
    g_nWindowMessages = 0;
    for (int i = 0; i < 3; ++i) ::PostMessageW(window.Get(), WM_APP, 0, 0);
    EXPECT_TRUE(PumpUntil([] { return g_nWindowMessages == 3; }, kWaitMs));
    EXPECT_FALSE(PumpUntil([] { return false; }, 20));
}

// ---- server call helpers --------------------------------------------------------------

// Records what reaches Invoke and answers like a server's type library does.
class CRecordingServer final : public IDispatch
{
public:
    DISPID m_dispid = 0;
    WORD m_wFlags = 0;
    bool m_bIidNull = false;
    std::vector<std::wstring> m_vecArgs;  // rgvarg order, as text
    std::vector<VARTYPE> m_vecTypes;
    bool m_bFail = false;
    static bool s_bDeferredCalled;

    STDMETHOD(QueryInterface)(REFIID riid, void** ppv) override
    {
        *ppv = riid == IID_IUnknown || riid == IID_IDispatch ? static_cast<IDispatch*>(this) : nullptr;
        return *ppv ? S_OK : E_NOINTERFACE;
    }
    STDMETHOD_(ULONG, AddRef)() override { return 2; }
    STDMETHOD_(ULONG, Release)() override { return 1; }
    STDMETHOD(GetTypeInfoCount)(UINT* p) override { return *p = 0, S_OK; }
    STDMETHOD(GetTypeInfo)(UINT, LCID, ITypeInfo**) override { return DISP_E_BADINDEX; }
    STDMETHOD(GetIDsOfNames)(REFIID, LPOLESTR* rgszNames, UINT, LCID, DISPID* rgDispId) override
    {
        const std::wstring strName = rgszNames[0];
        *rgDispId = strName == L"Exec" ? 11 : strName == L"ExecCom" ? 12 : strName == L"Quit" ? 13 : DISPID_UNKNOWN;
        return *rgDispId == DISPID_UNKNOWN ? DISP_E_UNKNOWNNAME : S_OK;
    }
    STDMETHOD(Invoke)(DISPID dispid, REFIID riid, LCID, WORD wFlags, DISPPARAMS* pParams, VARIANT* pVarResult,
                      EXCEPINFO* pExcepInfo, UINT*) override
    {
        m_dispid = dispid;
        m_wFlags = wFlags;
        m_bIidNull = riid == IID_NULL;
        try {
            Record(pParams);
        } catch (...) {
            return E_OUTOFMEMORY;
        }
        if (m_bFail) {
            *pExcepInfo = EXCEPINFO();
            pExcepInfo->pfnDeferredFillIn = FillIn;
            return DISP_E_EXCEPTION;
        }
        V_VT(pVarResult) = VT_BSTR;
        V_BSTR(pVarResult) = ::SysAllocString(L"result");
        return S_OK;
    }

private:
    void Record(const DISPPARAMS* pParams)
    {
        m_vecArgs.clear();
        m_vecTypes.clear();
        for (UINT i = 0; i < pParams->cArgs; ++i) {
            const VARIANT& var = pParams->rgvarg[i];
            m_vecTypes.push_back(V_VT(&var));
            m_vecArgs.push_back(V_VT(&var) == VT_BSTR ? std::wstring(V_BSTR(&var)) : L"?");
        }
    }

    static HRESULT STDAPICALLTYPE FillIn(EXCEPINFO* pExcepInfo)
    {
        s_bDeferredCalled = true;
        pExcepInfo->scode = E_ABORT;
        pExcepInfo->bstrDescription = ::SysAllocString(L"KeyboardInterrupt");
        pExcepInfo->bstrSource = ::SysAllocString(L"Repl.Server");
        pExcepInfo->pfnDeferredFillIn = nullptr;
        return S_OK;
    }
};
bool CRecordingServer::s_bDeferredCalled = false;

TEST(ServerCalls, ExecPassesCommandAndArgumentInReverseOrder)
{
    CRecordingServer server;
    CallResult result = CallExec(&server, L"echo", L"text");
    EXPECT_EQ(result.hr, S_OK);
    EXPECT_EQ(result.Text(), L"result");
    EXPECT_EQ(server.m_dispid, DISPID_REPL_EXEC);
    EXPECT_EQ(server.m_wFlags, DISPATCH_METHOD);
    EXPECT_TRUE(server.m_bIidNull);
    EXPECT_EQ(server.m_vecArgs, (std::vector<std::wstring>{L"text", L"echo"}));

    CallExec(&server, L"echo", L"text", true);
    EXPECT_EQ(server.m_dispid, 11);
    CallQuit(&server, true);
    EXPECT_EQ(server.m_dispid, 13);
    EXPECT_TRUE(server.m_vecArgs.empty());
    VARIANT varFive;
    ::VariantInit(&varFive);
    V_VT(&varFive) = VT_I4;
    V_I4(&varFive) = 5;
    CallExecCom(&server, L"com-echo", varFive);
    EXPECT_EQ(server.m_dispid, DISPID_REPL_EXECCOM);
    EXPECT_EQ(server.m_vecTypes, (std::vector<VARTYPE>{VT_I4, VT_BSTR}));
}

TEST(ServerCalls, ExceptionInfoIsCapturedWithDeferredFillIn)
{
    CRecordingServer server;
    server.m_bFail = true;
    CallResult result = CallExec(&server, L"spin", L"");
    EXPECT_EQ(result.hr, DISP_E_EXCEPTION);
    EXPECT_TRUE(CRecordingServer::s_bDeferredCalled);
    EXPECT_TRUE(result.bHasExcepInfo);
    EXPECT_EQ(result.hrScode, E_ABORT);
    EXPECT_EQ(result.Effective(), E_ABORT);
    EXPECT_FALSE(result.bNullDescription);
    EXPECT_EQ(result.strDescription, L"KeyboardInterrupt");
    EXPECT_EQ(result.strSource, L"Repl.Server");

    CallResult moved(std::move(result));
    EXPECT_EQ(moved.strDescription, L"KeyboardInterrupt");
    EXPECT_EQ(InvokeByName(&server, L"Nope").hr, DISP_E_UNKNOWNNAME);
    EXPECT_EQ(DescribeHResult(E_ABORT), L"0x80004004 (E_ABORT)");
}

// ---- the interrupt pipe ---------------------------------------------------------------

std::string ReadExactly(HANDLE hRead, DWORD cb)
{
    std::string strData;
    char szBuffer[16];
    DWORD cbRead = 0;
    while (strData.size() < cb && ::ReadFile(hRead, szBuffer, sizeof(szBuffer), &cbRead, nullptr)) {
        strData.append(szBuffer, cbRead);
    }
    return strData;
}

TEST(InterruptPipe, CommandsArriveInOrderAndOnlyTheReadEndIsInheritable)
{
    CInterruptPipe pipe;
    ASSERT_HRESULT_SUCCEEDED(pipe.Create());
    DWORD dwFlags = 0;
    ASSERT_TRUE(::GetHandleInformation(pipe.ReadHandle(), &dwFlags));
    EXPECT_TRUE(dwFlags & HANDLE_FLAG_INHERIT);
    ASSERT_TRUE(::GetHandleInformation(pipe.WriteHandle(), &dwFlags));
    EXPECT_FALSE(dwFlags & HANDLE_FLAG_INHERIT);
    EXPECT_EQ(pipe.ReadHandleText(), std::to_wstring(reinterpret_cast<ULONG_PTR>(pipe.ReadHandle())));

    EXPECT_TRUE(pipe.Send(CInterruptPipe::kInterrupt));
    EXPECT_TRUE(pipe.Send(CInterruptPipe::kInterruptAll));
    EXPECT_TRUE(pipe.SendRaw("ak"));
    EXPECT_EQ(ReadExactly(pipe.ReadHandle(), 4), "akak");

    pipe.CloseWrite();
    EXPECT_FALSE(pipe.Send('a'));
    char ch = 0;
    DWORD cbRead = 0;
    EXPECT_FALSE(::ReadFile(pipe.ReadHandle(), &ch, 1, &cbRead, nullptr));
    EXPECT_EQ(::GetLastError(), static_cast<DWORD>(ERROR_BROKEN_PIPE));
}

TEST(InterruptPipe, AChildReadsTheInheritedReadEndUntilTheWriteEndCloses)
{
    CInterruptPipe pipe;
    ASSERT_HRESULT_SUCCEEDED(pipe.Create());
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"pipe " + pipe.ReadHandleText() + L" 10");
    options.bCaptureOutput = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    pipe.CloseRead();
    ASSERT_TRUE(pipe.Send('a'));
    ASSERT_TRUE(WaitForOutput(child, "read:a"));
    ASSERT_TRUE(pipe.Send('k'));
    ASSERT_TRUE(WaitForOutput(child, "read:k"));
    pipe.CloseWrite();
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(2));
}

// ---- the host process ----------------------------------------------------------------

TEST(HostProcess, CapturesStdoutAndStderrAndFeedsStdin)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"output");
    options.bCaptureOutput = true;
    options.strStdin = std::string("hello there");
    std::atomic<size_t> cbSeen{0};
    options.fnOutput = [&](const std::string& strChunk) { cbSeen += strChunk.size(); };
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    EXPECT_NE(child.ProcessId(), 0u);
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(0));
    std::string strOutput = child.Output();
    EXPECT_NE(strOutput.find("out-text"), std::string::npos);
    EXPECT_NE(strOutput.find("err-text"), std::string::npos);
    EXPECT_NE(strOutput.find("stdin=hello there"), std::string::npos) << strOutput;
    EXPECT_EQ(cbSeen.load(), strOutput.size());
    EXPECT_TRUE(child.HasExited());
}

TEST(HostProcess, StdinIsEmptyUnlessGiven)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"output");
    options.bCaptureOutput = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(0));
    EXPECT_NE(child.Output().find("stdin=\r\n"), std::string::npos) << child.Output();
}

TEST(HostProcess, AMissingProgramFailsToStart)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = QuoteArg(ProgramDirectory() + L"\\no_such_program.exe");
    EXPECT_FALSE(SUCCEEDED(child.Start(options)));
    options.bDebug = true;
    CHostProcess debugged;
    EXPECT_FALSE(SUCCEEDED(debugged.Start(options)));
    EXPECT_FALSE(debugged.WaitForExit(0));
}

TEST(HostProcess, DebugModeCollectsEveryLineWholeFromEveryThread)
{
    constexpr int kThreads = 4, kLines = 50;
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"debug " + std::to_wstring(kThreads) + L" " + std::to_wstring(kLines) + L" 5");
    options.bDebug = true;
    std::atomic<int> nCallbacks{0};
    options.fnDebugLine = [&](const std::string&) { ++nCallbacks; };
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(5));

    std::vector<std::string> vecLines = child.Lines();
    std::map<int, int> mapNext;
    size_t nThreadLines = 0;
    for (const std::string& strLine : vecLines) {
        if (strLine.rfind("t", 0) != 0) continue;
        ++nThreadLines;
        int nThread = 0, nIndex = 0;
        ASSERT_EQ(std::sscanf(strLine.c_str(), "t%d %d", &nThread, &nIndex), 2) << strLine;
        EXPECT_EQ(strLine, "t" + std::to_string(nThread) + " " + std::to_string(nIndex) + "\n");
        EXPECT_EQ(nIndex, mapNext[nThread]++);
    }
    EXPECT_EQ(nThreadLines, static_cast<size_t>(kThreads * kLines));
    EXPECT_EQ(vecLines.back(), "wide line\n");
    EXPECT_EQ(nCallbacks.load(), static_cast<int>(vecLines.size()));
}

TEST(HostProcess, ExceptionsGoToTheChildsOwnHandlers)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"veh");
    options.bDebug = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(0));
    EXPECT_EQ(child.Lines(), std::vector<std::string>{"handled=1\n"});
}

TEST(HostProcess, WaitForLineFindsLinesAndGivesUpWhenTheChildHasEnded)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"tick 3 10");
    options.bDebug = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    std::string strLine;
    EXPECT_TRUE(child.WaitForLine("tick 2", kWaitMs, &strLine));
    EXPECT_EQ(strLine, "tick 2\n");
    EXPECT_TRUE(child.WaitForLine([](const std::string& str) { return str == "tick 0\n"; }, kWaitMs));
    EXPECT_FALSE(child.WaitForLine("never written", kWaitMs));
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(7));
}

TEST(HostProcess, KillEndsADebuggedChildWithTheGivenCode)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"tick 100000 10");
    options.bDebug = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    ASSERT_TRUE(child.WaitForLine("tick 1", kWaitMs));
    EXPECT_FALSE(child.HasExited());
    child.Kill(9);
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(9));
}

TEST(HostProcess, AttachCollectsTheLinesOfARunningProcess)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"tick 150 20");
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    CHostProcess debugger;
    ASSERT_HRESULT_SUCCEEDED(debugger.Attach(child.ProcessId()));
    std::string strLine;
    ASSERT_TRUE(debugger.WaitForLine("tick", kWaitMs, &strLine));
    EXPECT_EQ(strLine.rfind("tick ", 0), 0u);
    EXPECT_EQ(debugger.WaitForExit(kWaitMs), std::optional<DWORD>(7));
    EXPECT_EQ(debugger.Lines().back(), "tick 149\n");
}

TEST(HostProcess, DetachingLeavesTheChildRunning)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"tick 100 20");
    options.bDebug = true;
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    ASSERT_TRUE(child.WaitForLine("tick 1", kWaitMs));
    child.Detach();
    size_t nLines = child.Lines().size();
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(7));
    EXPECT_LT(child.Lines().size(), 100u);
    EXPECT_GE(child.Lines().size(), nLines);
}

TEST(HostProcess, TheDebuggersDeathDoesNotKillTheChild)
{
    CHostProcess child;
    HostOptions options;
    options.strCommandLine = ChildCommand(L"tick 100 20");
    ASSERT_HRESULT_SUCCEEDED(child.Start(options));
    CHostProcess viewer;
    HostOptions viewerOptions;
    viewerOptions.strCommandLine = SiblingCommand(L"repl_logview.exe", L"--pid " + std::to_wstring(child.ProcessId()));
    viewerOptions.bCaptureOutput = true;
    ASSERT_HRESULT_SUCCEEDED(viewer.Start(viewerOptions));
    ASSERT_TRUE(WaitForOutput(viewer, "tick"));
    viewer.Kill(1);
    EXPECT_EQ(viewer.WaitForExit(kWaitMs), std::optional<DWORD>(1));
    EXPECT_EQ(child.WaitForExit(kWaitMs), std::optional<DWORD>(7));
}

// ---- a whole session against the stand-in server ------------------------------------

class Session : public ComTest
{
protected:
    SessionOptions Options() const
    {
        SessionOptions options;
        options.strHostCommand = ChildCommand(L"fakeserver");
        options.host.bDebug = true;
        return options;
    }
};

TEST_F(Session, ConnectsRunsCommandsAndQuitsCleanly)
{
    CReplSession session;
    ASSERT_HRESULT_SUCCEEDED(session.Start(Options()));
    ASSERT_TRUE(session.WaitConnected(kWaitMs));
    CComPtr<IDispatch> spServer = session.Server();
    ASSERT_TRUE(spServer);

    EXPECT_EQ(CallExec(spServer, L"echo", L"hi").Text(), L"hi");
    EXPECT_EQ(CallExec(spServer, L"echo", L"by name", true).Text(), L"by name");
    EXPECT_EQ(CallExec(spServer, L"print", L"out\n").hr, S_OK);
    EXPECT_EQ(CallExec(spServer, L"eprint", L"err\n").hr, S_OK);
    EXPECT_EQ(session.Client().Output(false), L"out\n");
    EXPECT_EQ(session.Client().Output(true), L"err\n");
    for (const auto& call : session.Client().CallsOf(CReplClientObject::DISPID_PRINT)) {
        EXPECT_EQ(call.dwThreadId, ::GetCurrentThreadId());
    }
    session.Client().QueueInput(CInputAnswer::Text(L"Ada"));
    EXPECT_EQ(CallExec(spServer, L"input", L"name? ").Text(), L"Ada");
    EXPECT_EQ(CallExec(spServer, L"input", L"again? ").strDescription, L"EOFError");
    CallResult failed = CallExec(spServer, L"fail", L"it broke");
    EXPECT_EQ(failed.hr, DISP_E_EXCEPTION);
    EXPECT_EQ(failed.Effective(), DISP_E_EXCEPTION);
    EXPECT_EQ(failed.strDescription, L"it broke");
    VARIANT varSeven;
    ::VariantInit(&varSeven);
    V_VT(&varSeven) = VT_I4;
    V_I4(&varSeven) = 7;
    CallResult com = CallExecCom(spServer, L"com-echo", varSeven);
    EXPECT_EQ(V_VT(&com.varResult), VT_I4);
    EXPECT_EQ(V_I4(&com.varResult), 7);
    spServer.Release();

    CallResult quit;
    EXPECT_EQ(session.Finish(kWaitMs, &quit), std::optional<DWORD>(0));
    EXPECT_EQ(quit.hr, S_OK);
    EXPECT_TRUE(session.Client().WasDetached());
    EXPECT_EQ(session.Client().RefCount(), 1u);
    auto vecLines = session.Host().Lines();
    EXPECT_NE(std::find(vecLines.begin(), vecLines.end(), "fakeserver: attached\n"), vecLines.end());
    EXPECT_EQ(vecLines.back(), "fakeserver: done\n");
}

TEST_F(Session, APipeInterruptEndsARunningCommand)
{
    CReplSession session;
    ASSERT_HRESULT_SUCCEEDED(session.Start(Options()));
    ASSERT_TRUE(session.WaitConnected(kWaitMs));
    // The byte is in the pipe before the command starts reading it.
    ASSERT_TRUE(session.Pipe().Send(CInterruptPipe::kInterrupt));
    CallResult spun = CallExec(session.Server(), L"spin", std::to_wstring(kWaitMs));
    EXPECT_EQ(spun.hr, DISP_E_EXCEPTION);
    EXPECT_EQ(spun.Effective(), E_ABORT);
    EXPECT_EQ(spun.strDescription, L"KeyboardInterrupt");
    EXPECT_EQ(session.Finish(kWaitMs), std::optional<DWORD>(0));
}

TEST_F(Session, TheClientMayCallTheServerFromInsideAServerCall)
{
    CReplSession session;
    CComPtr<CReplClientObject> spClient = CReplClientObject::Create();
    std::wstring strInner;
    spClient->SetCallHook([&](const CReplClientObject::Call& call) -> std::optional<HRESULT> {
        if (call.dispid == CReplClientObject::DISPID_PRINT && call.strText == L"outer") {
            strInner = CallExec(session.Server(), L"echo", L"inner").Text();
        }
        return std::nullopt;
    });
    ASSERT_HRESULT_SUCCEEDED(session.Start(Options(), spClient));
    ASSERT_TRUE(session.WaitConnected(kWaitMs));
    EXPECT_EQ(CallExec(session.Server(), L"print", L"outer").hr, S_OK);
    EXPECT_EQ(strInner, L"inner");
    EXPECT_EQ(session.Finish(kWaitMs), std::optional<DWORD>(0));
}

TEST_F(Session, TheServerEndingTheRunDetachesWithoutQuit)
{
    CReplSession session;
    ASSERT_HRESULT_SUCCEEDED(session.Start(Options()));
    ASSERT_TRUE(session.WaitConnected(kWaitMs));
    EXPECT_EQ(CallExec(session.Server(), L"quit", L"").Text(), L"quit");
    EXPECT_TRUE(session.Client().WasDetached());
    CallResult quit;
    EXPECT_EQ(session.Finish(kWaitMs, &quit), std::optional<DWORD>(0));
    EXPECT_EQ(quit.hr, E_UNEXPECTED);  // never called
}

TEST_F(Session, ABadClientTextNeverConnects)
{
    CReplSession session;
    SessionOptions options = Options();
    options.strClientTextOverride = std::string("@@@@");
    ASSERT_HRESULT_SUCCEEDED(session.Start(options));
    EXPECT_FALSE(session.WaitConnected(kWaitMs));
    EXPECT_EQ(session.Finish(kWaitMs), std::optional<DWORD>(2));
    EXPECT_EQ(session.Host().Lines(), std::vector<std::string>{"fakeserver: cannot attach\n"});
    EXPECT_EQ(session.Client().RefCount(), 1u);
}

TEST_F(Session, TheCommandLineCarriesTextPidAndPipe)
{
    CReplSession session;
    SessionOptions options = Options();
    options.strExtraArgs = L"--extra";
    ASSERT_HRESULT_SUCCEEDED(session.Start(options));
    const std::wstring& strLine = session.CommandLine();
    std::wstring strExpectedTail = L" " + Utf8ToWide(session.ClientText()) + L" " +
                                   std::to_wstring(::GetCurrentProcessId()) + L" ";
    EXPECT_NE(strLine.find(strExpectedTail), std::wstring::npos) << strLine;
    EXPECT_EQ(strLine.substr(strLine.size() - 8), L" --extra");
    ASSERT_TRUE(session.WaitConnected(kWaitMs));
    EXPECT_EQ(session.Finish(kWaitMs), std::optional<DWORD>(0));
}

}  // namespace
