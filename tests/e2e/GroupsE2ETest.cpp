// A client in this process creates the server out of process through COM and
// works with groups across the process boundary.
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "TaskMem.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <limits>
#include <string>
#include <vector>

namespace {
constexpr DWORD kExitTimeoutMs = 20000;

ComPtr<IOPCServer> CreateServer()
{
    ComPtr<IOPCServer> server;
    HRESULT hr = CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                  reinterpret_cast<void **>(server.Out()));
    EXPECT_EQ(hr, S_OK);
    return server;
}

std::vector<std::wstring> Names(IOPCServer *server)
{
    std::vector<std::wstring> names;
    ComPtr<IEnumString> e;
    if (FAILED(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumString, reinterpret_cast<IUnknown **>(e.Out()))))
        return names;
    LPOLESTR batch[4];
    ULONG fetched = 0;
    HRESULT hr;
    do {
        hr = e->Next(4, batch, &fetched);
        for (ULONG i = 0; i < fetched; ++i) {
            names.emplace_back(batch[i] ? batch[i] : L"<null>");
            CoTaskMemFree(batch[i]);
        }
    } while (hr == S_OK);
    return names;
}

std::wstring NameOf(IOPCGroupStateMgt *group)
{
    DWORD rate, lcid;
    BOOL active;
    LPWSTR name = nullptr;
    LONG bias;
    FLOAT deadband;
    OPCHANDLE client, srv;
    if (FAILED(group->GetState(&rate, &active, &name, &bias, &deadband, &lcid, &client, &srv)))
        return L"<failed>";
    TaskMem<wchar_t> owned(name);
    return name ? name : L"<null>";
}

class GroupsE2E : public testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(WaitForNoServerProcess(kExitTimeoutMs)) << "a server of an earlier test"; }
    void TearDown() override { EXPECT_TRUE(WaitForNoServerProcess(kExitTimeoutMs)) << "the server did not exit"; }
};
} // namespace

TEST_F(GroupsE2E, ClientManagesGroupsAcrossTheProcessBoundary)
{
    auto server = CreateServer();
    ASSERT_TRUE(server);
    EXPECT_EQ(CountServerProcesses(), 1);

    struct Added {
        OPCHANDLE handle = 0;
        DWORD revised = 0;
        ComPtr<IOPCGroupStateMgt> group;
        HRESULT hr = E_FAIL;
    };
    auto add = [&](const wchar_t *name, DWORD rate) {
        Added a;
        FLOAT deadband = 5.0f;
        a.hr = server->AddGroup(name, TRUE, rate, 7, nullptr, &deadband, 0x409, &a.handle, &a.revised,
                                IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(a.group.Out()));
        return a;
    };
    Added given = add(L"Given", 250);
    Added generated = add(L"", 5);
    Added second = add(L"Second", 1000);
    ASSERT_EQ(given.hr, S_OK);
    ASSERT_EQ(generated.hr, OPC_S_UNSUPPORTEDRATE);
    EXPECT_EQ(generated.revised, 10u);
    ASSERT_EQ(second.hr, S_OK);
    EXPECT_EQ(add(L"Given", 100).hr, OPC_E_DUPLICATENAME);
    std::wstring generatedName = NameOf(generated.group.Get());
    EXPECT_EQ(generatedName.rfind(L"$Group_", 0), 0u) << generatedName;

    auto names = Names(server.Get());
    EXPECT_EQ(names, (std::vector<std::wstring>{generatedName, L"Given", L"Second"}));

    OPCSERVERSTATUS *raw = nullptr;
    ASSERT_EQ(server->GetStatus(&raw), S_OK);
    TaskMem<OPCSERVERSTATUS> status(raw);
    TaskMem<wchar_t> vendor(status->szVendorInfo);
    EXPECT_EQ(status->dwGroupCount, 3u);
    EXPECT_EQ(status->dwServerState, OPC_STATUS_RUNNING);
    EXPECT_STREQ(vendor.Get(), L"Tarnwell");
    EXPECT_EQ(status->wBuildNumber, 21);

    ComPtr<IOPCGroupStateMgt> byName;
    ASSERT_EQ(server->GetGroupByName(L"Second", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(byName.Out())),
              S_OK);
    EXPECT_EQ(NameOf(byName.Get()), L"Second");
    EXPECT_EQ(byName->SetName(L"Renamed"), S_OK);
    EXPECT_EQ(NameOf(second.group.Get()), L"Renamed");

    // Removal without force while this client holds the group; then forced.
    EXPECT_EQ(server->RemoveGroup(given.handle, FALSE), OPC_S_INUSE);
    EXPECT_EQ(NameOf(given.group.Get()), L"<failed>");
    EXPECT_EQ(server->RemoveGroup(given.handle, FALSE), E_INVALIDARG);
    EXPECT_EQ(server->RemoveGroup(second.handle, TRUE), S_OK);
    EXPECT_EQ(NameOf(byName.Get()), L"<failed>") << "a forcibly removed group is disconnected";
    EXPECT_EQ(Names(server.Get()), std::vector<std::wstring>{generatedName});

    given.group.Reset();
    second.group.Reset();
    byName.Reset();
    generated.group.Reset();
    server.Reset();
    EXPECT_TRUE(WaitForNoServerProcess(kExitTimeoutMs)) << "the server exits once every object is released";
}

TEST_F(GroupsE2E, ServerExitsWhenTheClientReleasesAServerThatHoldsGroups)
{
    auto server = CreateServer();
    ASSERT_TRUE(server);
    ComPtr<IUnknown> group;
    OPCHANDLE handle;
    DWORD revised;
    ASSERT_EQ(
        server->AddGroup(L"left", TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IUnknown, group.Out()),
        S_OK);
    group.Reset();
    server.Reset(); // the server's final release removes the group by force
}

TEST_F(GroupsE2E, BadInputAcrossTheWireGetsTheDocumentedCodes)
{
    auto server = CreateServer();
    ASSERT_TRUE(server);
    OPCHANDLE handle;
    DWORD revised;
    ComPtr<IUnknown> unk;
    FLOAT nan = std::numeric_limits<FLOAT>::quiet_NaN();
    EXPECT_EQ(server->AddGroup(L"n", TRUE, 100, 0, nullptr, &nan, 0, &handle, &revised, IID_IUnknown, unk.Out()),
              E_INVALIDARG);
    EXPECT_EQ(server->AddGroup(L"n", TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IDispatch, unk.Out()),
              E_NOINTERFACE);
    EXPECT_EQ(server->RemoveGroup(0xDEADBEEF, TRUE), E_INVALIDARG);
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_PUBLIC, IID_IEnumString, unk.Out()), E_FAIL);
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_PUBLIC, IID_IEnumUnknown, unk.Out()), S_FALSE);
    std::wstring huge(10000, L'n');
    EXPECT_EQ(
        server->AddGroup(huge.c_str(), TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IUnknown, unk.Out()),
        S_OK);
    unk.Reset();
    EXPECT_EQ(Names(server.Get()), std::vector<std::wstring>{huge});

    // Error texts come from the server executable's message table.
    LPWSTR text = nullptr;
    ASSERT_EQ(server->GetErrorString(OPC_S_INUSE, 0x409, &text), S_OK);
    EXPECT_STREQ(text,
                 L"The operation cannot be completed because the \r\nobject still has references that exist.\r\n");
    CoTaskMemFree(text);
    EXPECT_EQ(server->GetErrorString(static_cast<HRESULT>(0xC004FFFF), 0x409, &text), E_FAIL);
}
