// IOPCCommon, the error texts and the shutdown connection point of the
// server object.
#include "InProcServer.h"
#include "OpcErrors.h"
#include "opccomn.h"

#include <olectl.h>

namespace {
class ShutdownSink : public IOPCShutdown {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCShutdown)) {
            *ppv = this;
            AddRef();
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return ++refs; }
    STDMETHODIMP_(ULONG) Release() override { return --refs; }
    STDMETHODIMP ShutdownRequest(LPCWSTR) override { return S_OK; }
    ULONG refs = 1;
};

std::wstring Text(IOPCServer *server, HRESULT code, HRESULT *hr = nullptr)
{
    LPWSTR text = nullptr;
    HRESULT result = server->GetErrorString(code, 0x409, &text);
    if (hr)
        *hr = result;
    std::wstring out = text ? text : L"<null>";
    CoTaskMemFree(text);
    return out;
}
} // namespace

TEST(Common, ErrorTextsComeFromTheMessageTableAndTheSystem)
{
    auto server = CreateInProcServer();
    struct {
        HRESULT code;
        const wchar_t *text;
    } texts[] = {
        {OPC_S_UNSUPPORTEDRATE,
         L"The server does not support the requested data rate \r\nbut will use the closest available rate.\r\n"},
        {OPC_S_CLAMP, L"A value passed to WRITE was accepted but the output was clamped.\r\n"},
        {OPC_S_INUSE, L"The operation cannot be completed because the \r\nobject still has references that exist.\r\n"},
        {OPC_E_INVALIDHANDLE, L"The value of the handle is invalid.\r\n"},
        {OPC_E_BADTYPE, L"The server cannot convert the data between the \r\nrequested data type and the canonical "
                        L"data type.\r\n"},
        {OPC_E_PUBLIC, L"The requested operation cannot be done on a public group.\r\n"},
        {OPC_E_BADRIGHTS, L"The Items AccessRights do not allow the operation.\r\n"},
        {OPC_E_UNKNOWNITEMID, L"The item is no longer available in the server address space.\r\n"},
        {OPC_E_INVALIDITEMID, L"The item definition doesn't conform to the server's syntax.\r\n"},
        {OPC_E_INVALIDFILTER, L"The filter string was not valid.\r\n"},
        {OPC_E_UNKNOWNPATH, L"The item's access path is not known to the server.\r\n"},
        {OPC_E_RANGE, L"The value was out of range.\r\n"},
        {OPC_E_DUPLICATENAME, L"Duplicate name not allowed.\r\n"},
        {OPC_E_INVALIDCONFIGFILE, L"The server's configuration file is an invalid format.\r\n"},
        {OPC_E_NOTFOUND, L"The server could not locate the requested object.\r\n"},
        {OPC_E_INVALID_PID, L"The server does not recognise the passed property ID.\r\n"},
    };
    for (const auto &t : texts)
        EXPECT_EQ(Text(server.Get(), t.code), t.text) << std::hex << t.code;
    HRESULT hr;
    EXPECT_EQ(Text(server.Get(), E_OUTOFMEMORY, &hr), L"Out of memory.\r\n");
    EXPECT_EQ(hr, S_OK);
    EXPECT_EQ(Text(server.Get(), static_cast<HRESULT>(0xC004FFFF), &hr), L"<null>");
    EXPECT_EQ(hr, E_FAIL);
    EXPECT_EQ(server->GetErrorString(OPC_E_RANGE, 0x409, nullptr), E_INVALIDARG);
}

TEST(Common, LocalesAndClientName)
{
    auto server = CreateInProcServer();
    ComPtr<IOPCCommon> common;
    ASSERT_EQ(server.As(common), S_OK);
    LCID lcid = 1;
    EXPECT_EQ(common->GetLocaleID(&lcid), S_OK);
    EXPECT_EQ(lcid, 0x800u);
    EXPECT_EQ(common->SetLocaleID(0x409), S_OK);
    EXPECT_EQ(common->SetLocaleID(0x407), E_INVALIDARG);
    EXPECT_EQ(common->GetLocaleID(&lcid), S_OK);
    EXPECT_EQ(lcid, 0x409u);
    EXPECT_EQ(common->SetLocaleID(0), S_OK);
    EXPECT_EQ(common->GetLocaleID(nullptr), E_INVALIDARG);
    DWORD count = 0;
    LCID *locales = nullptr;
    ASSERT_EQ(common->QueryAvailableLocaleIDs(&count, &locales), S_OK);
    ASSERT_EQ(count, 3u);
    EXPECT_EQ(locales[0], 0x409u);
    EXPECT_EQ(locales[1], 0x800u);
    EXPECT_EQ(locales[2], 0u);
    CoTaskMemFree(locales);
    LPWSTR text = nullptr;
    EXPECT_EQ(common->GetErrorString(OPC_E_RANGE, &text), S_OK);
    EXPECT_STREQ(text, L"The value was out of range.\r\n");
    CoTaskMemFree(text);
    EXPECT_EQ(common->SetClientName(L"test client"), S_OK);
    EXPECT_EQ(common->SetClientName(nullptr), E_INVALIDARG);
}

TEST(Common, OneShutdownSinkPerServer)
{
    auto server = CreateInProcServer();
    ComPtr<IConnectionPointContainer> container;
    ASSERT_EQ(server.As(container), S_OK);
    ComPtr<IConnectionPoint> point;
    EXPECT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), CONNECT_E_NOCONNECTION);
    ASSERT_EQ(container->FindConnectionPoint(IID_IOPCShutdown, point.Out()), S_OK);
    ShutdownSink first, second;
    DWORD c1 = 0, c2 = 7;
    ASSERT_EQ(point->Advise(&first, &c1), S_OK);
    EXPECT_NE(c1, 0u);
    EXPECT_EQ(point->Advise(&second, &c2), CONNECT_E_ADVISELIMIT);
    EXPECT_EQ(c2, 0u);
    EXPECT_EQ(second.refs, 1u);
    EXPECT_EQ(point->Unadvise(0), CONNECT_E_NOCONNECTION);
    EXPECT_EQ(point->Unadvise(c1), S_OK);
    EXPECT_EQ(first.refs, 1u);
    ASSERT_EQ(point->Advise(&second, &c2), S_OK);
    EXPECT_EQ(c2, c1) << "the slot's cookie";
    IUnknown *notASink = server.Get();
    DWORD c3;
    EXPECT_EQ(point->Advise(notASink, &c3), CONNECT_E_CANNOTCONNECT);
    point.Reset();
    container.Reset();
    server.Reset();
    EXPECT_EQ(second.refs, 1u) << "released with the server";
}
