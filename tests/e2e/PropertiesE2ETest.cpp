// Item properties and the shutdown connection point from a client process.
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "opccomn.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <chrono>
#include <ocidl.h>
#include <olectl.h>

namespace {
class ShutdownSink : public IOPCShutdown {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCShutdown)) {
            *ppv = this;
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    STDMETHODIMP ShutdownRequest(LPCWSTR) override { return S_OK; }
};
} // namespace

TEST(PropertiesE2E, PropertiesOfLeavesAndTheShutdownSlot)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    ShutdownSink first, second;
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        ComPtr<IOPCItemProperties> props;
        ASSERT_EQ(server.As(props), S_OK);
        DWORD which[] = {1, 2, 5, 6, 101};
        VARIANT *v = nullptr;
        HRESULT *e = nullptr;
        ASSERT_EQ(
            props->GetItemProperties(const_cast<wchar_t *>(L"\\\\PLANT7\\control\\Boiler.burner"), 5, which, &v, &e),
            S_OK);
        EXPECT_EQ(V_I2(&v[0]), VT_BOOL);
        EXPECT_EQ(V_VT(&v[1]), VT_BOOL);
        EXPECT_EQ(V_I4(&v[2]), 3);
        EXPECT_EQ(V_R4(&v[3]), 1.0f);
        EXPECT_STREQ(V_BSTR(&v[4]), L"burner");
        for (int i = 0; i < 5; ++i)
            VariantClear(&v[i]);
        CoTaskMemFree(v);
        CoTaskMemFree(e);
        // Property 6 at once for a member that never delivers.
        DWORD scanRate[] = {6};
        auto start = std::chrono::steady_clock::now();
        ASSERT_EQ(
            props->GetItemProperties(const_cast<wchar_t *>(L"\\\\.\\proc1\\Setpoints.never"), 1, scanRate, &v, &e),
            S_OK);
        EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
        CoTaskMemFree(v);
        CoTaskMemFree(e);

        ComPtr<IConnectionPointContainer> container;
        ASSERT_EQ(server.As(container), S_OK);
        ComPtr<IConnectionPoint> point;
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCShutdown, point.Out()), S_OK);
        DWORD c1 = 0, c2 = 0;
        EXPECT_EQ(point->Advise(&first, &c1), S_OK);
        EXPECT_EQ(point->Advise(&second, &c2), CONNECT_E_ADVISELIMIT) << "one shutdown sink per server";
        EXPECT_EQ(c2, 0u);
    } // the server releases the sink still advised
    EXPECT_TRUE(WaitForNoServerProcess(20000));
    CoDisconnectObject(&first, 0);
    CoDisconnectObject(&second, 0);
}

TEST(PropertiesE2E, TheShutdownPointIsOneObjectAndItsConnectionsEnumerateAcrossTheBoundary)
{
    ShutdownSink sink;
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        ComPtr<IConnectionPointContainer> container;
        ASSERT_EQ(server.As(container), S_OK);
        ComPtr<IConnectionPoint> point, again;
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCShutdown, point.Out()), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCShutdown, again.Out()), S_OK);
        EXPECT_EQ(point.Get(), again.Get()) << "one connection point object";

        ComPtr<IEnumConnections> connections;
        ASSERT_EQ(point->EnumConnections(connections.Out()), S_OK);
        CONNECTDATA data = {};
        ULONG fetched = 7;
        EXPECT_EQ(connections->Next(1, &data, &fetched), S_FALSE) << "no sink: the enumerator just runs out";
        EXPECT_EQ(fetched, 0u);

        DWORD cookie = 0;
        ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
        connections.Reset();
        ASSERT_EQ(point->EnumConnections(connections.Out()), S_OK);
        // With a sink advised, Wine's own IEnumConnections proxy is at
        // fault: it hands back a count of 0, the sink without the reference
        // it should carry, and at times a result that is no HRESULT of ours.
        // What is ours: the server answers, lets go of the sink, and exits.
        for (int i = 0; i < 20; ++i) {
            connections->Reset();
            data = {};
            connections->Next(1, &data, &fetched);
        }
        connections.Reset();
        EXPECT_EQ(point->Unadvise(cookie), S_OK);
    }
    EXPECT_TRUE(WaitForNoServerProcess(20000)) << "the server did not exit";
    CoDisconnectObject(&sink, 0);
}
