#include "AsyncIOMgr.h"
#include "ClassFactory.h"
#include "ComModule.h"
#include "InProcServer.h"
#include "InterfaceAnchor.h"
#include "ItemServices.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "Services.h"
#include "Trace.h"
#include "UpdateScanMgr.h"

#include <atomic>
#include <cmath>
#include <thread>
#include <vector>

namespace {
// A pointer that IsBadWritePtr rejects.
template <class T> T *Garbage()
{
    return reinterpret_cast<T *>(static_cast<uintptr_t>(0x10));
}
} // namespace

TEST(Server, ClassObjectFollowsTheCreationRules)
{
    CServerClassFactory factory;
    EXPECT_EQ(factory.CreateInstance(nullptr, IID_IOPCServer, nullptr), E_POINTER);
    IUnknown *dummyOuter = reinterpret_cast<IUnknown *>(&factory);
    void *out = reinterpret_cast<void *>(1);
    EXPECT_EQ(factory.CreateInstance(dummyOuter, IID_IOPCServer, &out), CLASS_E_NOAGGREGATION);
    EXPECT_EQ(out, nullptr);
    ComPtr<IUnknown> dispatch;
    EXPECT_EQ(factory.CreateInstance(nullptr, IID_IDispatch, reinterpret_cast<void **>(dispatch.Out())), E_NOINTERFACE);

    LONG locks = ComModule::LockCount();
    EXPECT_EQ(factory.LockServer(TRUE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), locks + 1);
    EXPECT_EQ(factory.LockServer(FALSE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), locks);
}

TEST(Server, TheAnchorHoldsEveryExportedInterfaceWithoutKeepingTheServerAlive)
{
    LONG locks = ComModule::LockCount();
    CInterfaceAnchor anchor;
    ASSERT_EQ(anchor.Hold(ServerInterfaces()), S_OK); // every proxy/stub is registered
    EXPECT_EQ(anchor.HeldCount(), ServerInterfaces().size() + 1);
    EXPECT_EQ(ComModule::LockCount(), locks);

    // A real object's stubs come and go beside the anchor's.
    CServerClassFactory factory;
    ComPtr<IOPCServer> server;
    ASSERT_EQ(factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out())), S_OK);
    for (int round = 0; round < 3; ++round) {
        IStream *raw = nullptr;
        ASSERT_EQ(CreateStreamOnHGlobal(nullptr, TRUE, &raw), S_OK);
        ComPtr<IStream> stream = ComPtr<IStream>::Attach(raw);
        ASSERT_EQ(
            CoMarshalInterface(stream.Get(), IID_IOPCServer, server.Get(), MSHCTX_LOCAL, nullptr, MSHLFLAGS_NORMAL),
            S_OK);
        LARGE_INTEGER start = {};
        stream->Seek(start, STREAM_SEEK_SET, nullptr);
        EXPECT_EQ(CoReleaseMarshalData(stream.Get()), S_OK);
    }
    server.Reset();
    EXPECT_EQ(ComModule::LockCount(), locks);

    // An interface without a proxy/stub fails alone; the rest stay held.
    static const IID unknownToCom = {0x0badf00d, 0x1234, 0x5678, {1, 2, 3, 4, 5, 6, 7, 8}};
    CInterfaceAnchor partial;
    EXPECT_TRUE(FAILED(partial.Hold({&unknownToCom, &IID_IOPCServer})));
    EXPECT_EQ(partial.HeldCount(), 2u);
    partial.Release();
    EXPECT_EQ(partial.HeldCount(), 0u);
}

TEST(Server, SharedServicesLiveWhileAnyServerObjectDoes)
{
    EXPECT_EQ(ServerServices::ServerObjectCount(), 0);
    EXPECT_EQ(ServerServices::RealTimeClient(), nullptr);
    LONG locks = ComModule::LockCount();
    {
        auto first = CreateInProcServer();
        auto second = CreateInProcServer();
        EXPECT_EQ(ServerServices::ServerObjectCount(), 2);
        EXPECT_NE(ServerServices::RealTimeClient(), nullptr);
        EXPECT_NE(ServerServices::BrowserReceiver(), nullptr);
        EXPECT_NE(ServerServices::AddressSpace(), nullptr);
        EXPECT_EQ(CUpdateScanMgr::RefCount(), 2);
        EXPECT_EQ(CAsyncIOMgr::RefCount(), 2);
        first.Reset();
        EXPECT_NE(ServerServices::RealTimeClient(), nullptr);
        EXPECT_EQ(CUpdateScanMgr::RefCount(), 1);
    }
    EXPECT_EQ(ServerServices::ServerObjectCount(), 0);
    EXPECT_EQ(ServerServices::RealTimeClient(), nullptr);
    EXPECT_EQ(ServerServices::BrowserReceiver(), nullptr);
    EXPECT_NE(ServerServices::AddressSpace(), nullptr) << "the address space is kept";
    EXPECT_EQ(CUpdateScanMgr::RefCount(), 0);
    EXPECT_EQ(CAsyncIOMgr::RefCount(), 0);
    EXPECT_EQ(ComModule::LockCount(), locks);
}

TEST(Server, AnItemCreationHoldingTheRealTimeClientOutlivesTheServicesShutdown)
{
    // An AddItems in progress while the last server object goes: the item
    // keeps the client it took, and its subscription fails cleanly.
    auto server = CreateInProcServer();
    ComPtr<OPCCadroClient> client = ItemServices::RealTimeClient();
    ASSERT_TRUE(client);
    server.Reset(); // the services shut down
    EXPECT_FALSE(ItemServices::RealTimeClient());
    CadroDataItem *item = nullptr;
    EXPECT_EQ(client->Subscribe(L"\\\\.\\proc1\\Setpoints.temperature", nullptr, &item), E_FAIL);
    EXPECT_EQ(item, nullptr);
}

TEST(Server, AggregatedServerAnswersThroughItsInnerUnknown)
{
    CServerClassFactory factory;
    // The outer object here is a second, plain server: only its identity
    // matters to the aggregation rules.
    auto outer = CreateInProcServer();
    ComPtr<IUnknown> inner;
    ASSERT_EQ(factory.CreateInstance(outer.Get(), IID_IUnknown, reinterpret_cast<void **>(inner.Out())), S_OK);
    ComPtr<IOPCServer> innerServer;
    ASSERT_EQ(inner->QueryInterface(IID_IOPCServer, reinterpret_cast<void **>(innerServer.Out())), S_OK);
    ComPtr<IUnknown> identity;
    ASSERT_EQ(innerServer->QueryInterface(IID_IUnknown, reinterpret_cast<void **>(identity.Out())), S_OK);
    ComPtr<IUnknown> outerIdentity;
    outer->QueryInterface(IID_IUnknown, reinterpret_cast<void **>(outerIdentity.Out()));
    EXPECT_EQ(identity.Get(), outerIdentity.Get()) << "an aggregated object delegates to its outer unknown";
}

TEST(Server, FreshStatusReportsRunningVersionAndVendor)
{
    auto server = CreateInProcServer();
    EXPECT_EQ(server->GetStatus(nullptr), E_INVALIDARG);
    EXPECT_EQ(server->GetStatus(Garbage<OPCSERVERSTATUS *>()), E_INVALIDARG);
    OPCSERVERSTATUS *raw = nullptr;
    ASSERT_EQ(server->GetStatus(&raw), S_OK);
    TaskMem<OPCSERVERSTATUS> status(raw);
    TaskMem<wchar_t> vendor(status->szVendorInfo);
    EXPECT_EQ(status->dwGroupCount, 0u);
    EXPECT_EQ(status->ftLastUpdateTime.dwLowDateTime | status->ftLastUpdateTime.dwHighDateTime, 0u);
    EXPECT_NE(status->ftStartTime.dwHighDateTime, 0u);
    EXPECT_EQ(status->dwServerState, OPC_STATUS_RUNNING);
    EXPECT_EQ(status->dwBandWidth, 0xFFFFFFFFu);
    EXPECT_EQ(status->wMajorVersion, 1);
    EXPECT_EQ(status->wMinorVersion, 1);
    EXPECT_EQ(status->wBuildNumber, 21);
    EXPECT_STREQ(vendor.Get(), L"Tarnwell");
}

TEST(Server, AddGroupRevisesRatesAndChecksDeadbands)
{
    auto server = CreateInProcServer();
    for (DWORD rate : {0u, 1u, 9u}) {
        auto g = AddGroup(server.Get(), L"", rate);
        EXPECT_EQ(g.hr, OPC_S_UNSUPPORTEDRATE);
        EXPECT_EQ(g.revisedRate, 10u);
        EXPECT_EQ(StateOf(g.group.Get()).rate, 10u);
    }
    auto ten = AddGroup(server.Get(), L"ten", 10);
    EXPECT_EQ(ten.hr, S_OK);
    EXPECT_EQ(ten.revisedRate, 10u);
    auto hour = AddGroup(server.Get(), L"hour", 3600000);
    EXPECT_EQ(hour.hr, S_OK);
    EXPECT_EQ(hour.revisedRate, 3600000u);

    DWORD count = GroupCount(server.Get());
    for (FLOAT bad : {-0.1f, 100.5f, std::nanf("")}) {
        auto g = AddGroup(server.Get(), L"bad", 100, FALSE, &bad);
        EXPECT_EQ(g.hr, E_INVALIDARG) << bad;
        EXPECT_FALSE(g.group);
        EXPECT_EQ(g.handle, 0u);
    }
    EXPECT_EQ(GroupCount(server.Get()), count);
    for (FLOAT edge : {0.0f, 100.0f}) {
        auto g = AddGroup(server.Get(), edge == 0.0f ? L"zero" : L"hundred", 100, FALSE, &edge);
        EXPECT_EQ(g.hr, S_OK);
        EXPECT_EQ(StateOf(g.group.Get()).deadband, edge);
    }

    // The time bias is the machine's when none is given, else the client's.
    TIME_ZONE_INFORMATION tzi;
    GetTimeZoneInformation(&tzi);
    EXPECT_EQ(StateOf(ten.group.Get()).bias, tzi.Bias);
    LONG bias = -123;
    auto biased = AddGroup(server.Get(), L"biased", 100, FALSE, nullptr, &bias);
    EXPECT_EQ(StateOf(biased.group.Get()).bias, -123);
    EXPECT_EQ(StateOf(biased.group.Get()).client, 42u);
    EXPECT_EQ(StateOf(biased.group.Get()).lcid, 0x409u);
    EXPECT_EQ(StateOf(biased.group.Get()).server, biased.handle);
}

TEST(Server, AddGroupRejectsBadOutPointersAndChangesNothing)
{
    auto server = CreateInProcServer();
    OPCHANDLE handle;
    DWORD revised;
    IUnknown *unk;
    EXPECT_EQ(server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, nullptr, &revised, IID_IUnknown, &unk),
              E_INVALIDARG);
    EXPECT_EQ(server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, &handle, nullptr, IID_IUnknown, &unk),
              E_INVALIDARG);
    EXPECT_EQ(server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IUnknown, nullptr),
              E_INVALIDARG);
    EXPECT_EQ(
        server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, Garbage<OPCHANDLE>(), &revised, IID_IUnknown, &unk),
        E_INVALIDARG);
    EXPECT_EQ(server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IUnknown,
                               Garbage<IUnknown *>()),
              E_INVALIDARG);
    // An interface the group lacks: the group is removed again.
    unk = reinterpret_cast<IUnknown *>(1);
    EXPECT_EQ(server->AddGroup(L"a", TRUE, 100, 0, nullptr, nullptr, 0, &handle, &revised, IID_IDispatch, &unk),
              E_NOINTERFACE);
    EXPECT_EQ(unk, nullptr);
    EXPECT_EQ(GroupCount(server.Get()), 0u);
    EXPECT_TRUE(GroupNames(server.Get()).empty());
    EXPECT_EQ(AddGroup(server.Get(), L"a").hr, S_OK) << "the name is free again";
}

TEST(Server, GroupNamesAreUniqueCaseSensitiveAndGeneratedWhenEmpty)
{
    auto server = CreateInProcServer();
    auto a = AddGroup(server.Get(), L"Alpha");
    ASSERT_EQ(a.hr, S_OK);
    EXPECT_EQ(AddGroup(server.Get(), L"Alpha").hr, OPC_E_DUPLICATENAME);
    EXPECT_EQ(AddGroup(server.Get(), L"alpha").hr, S_OK);
    auto g1 = AddGroup(server.Get(), L"");
    auto g2 = AddGroup(server.Get(), nullptr);
    ASSERT_EQ(g1.hr, S_OK);
    ASSERT_EQ(g2.hr, S_OK);
    std::wstring n1 = StateOf(g1.group.Get()).name, n2 = StateOf(g2.group.Get()).name;
    EXPECT_NE(n1, n2);
    EXPECT_EQ(n1.rfind(L"$Group_", 0), 0u) << n1;
    EXPECT_EQ(n1.back(), L'$');
    std::wstring huge(10000, L'x');
    EXPECT_EQ(AddGroup(server.Get(), huge.c_str()).hr, S_OK);
    EXPECT_EQ(StateOf(AddGroup(server.Get(), (huge + L"y").c_str()).group.Get()).name.size(), 10001u);
    EXPECT_EQ(AddGroup(server.Get(), huge.c_str()).hr, OPC_E_DUPLICATENAME);
    EXPECT_EQ(GroupCount(server.Get()), 6u);

    ComPtr<IOPCGroupStateMgt> found;
    EXPECT_EQ(server->GetGroupByName(L"Alpha", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
              S_OK);
    EXPECT_EQ(StateOf(found.Get()).server, a.handle);
    EXPECT_EQ(server->GetGroupByName(L"ALPHA", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
              E_INVALIDARG);
    EXPECT_EQ(server->GetGroupByName(L"", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
              E_INVALIDARG);
    EXPECT_EQ(server->GetGroupByName(nullptr, IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
              E_INVALIDARG);
    EXPECT_EQ(server->GetGroupByName(L"Alpha", IID_IOPCGroupStateMgt, nullptr), E_INVALIDARG);
    EXPECT_EQ(server->GetGroupByName(L"Alpha", IID_IDispatch, reinterpret_cast<IUnknown **>(found.Out())),
              E_NOINTERFACE);
}

TEST(Server, RemoveGroupWithoutForceLeavesAClientHeldGroupInUse)
{
    auto server = CreateInProcServer();
    LONG locks = ComModule::LockCount();
    auto g = AddGroup(server.Get(), L"held");
    ASSERT_EQ(g.hr, S_OK);
    EXPECT_EQ(server->RemoveGroup(g.handle + 1000, FALSE), E_INVALIDARG);
    EXPECT_EQ(server->RemoveGroup(g.handle, FALSE), OPC_S_INUSE);
    EXPECT_EQ(GroupCount(server.Get()), 0u);
    EXPECT_EQ(server->RemoveGroup(g.handle, FALSE), E_INVALIDARG);
    ComPtr<IOPCGroupStateMgt> found;
    EXPECT_EQ(server->GetGroupByName(L"held", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
              E_INVALIDARG);
    EXPECT_EQ(StateOf(g.group.Get()).hr, E_FAIL) << "a group being removed fails every call";
    DWORD revised;
    EXPECT_EQ(g.group->SetState(nullptr, &revised, nullptr, nullptr, nullptr, nullptr, nullptr), E_FAIL);
    EXPECT_EQ(g.group->SetName(L"again"), E_FAIL);
    IUnknown *clone = nullptr;
    EXPECT_EQ(g.group->CloneGroup(L"c", IID_IUnknown, &clone), E_FAIL);
    EXPECT_EQ(ComModule::LockCount(), locks + 1);
    g.group.Reset();
    EXPECT_EQ(ComModule::LockCount(), locks) << "the client's release destroyed the group";

    auto unheld = AddGroup(server.Get(), L"unheld");
    unheld.group.Reset();
    EXPECT_EQ(server->RemoveGroup(unheld.handle, FALSE), S_OK);
    EXPECT_EQ(ComModule::LockCount(), locks);
}

TEST(Server, ForcedRemovalDestroysTheGroupWhateverClientsHold)
{
    auto server = CreateInProcServer();
    auto g = AddGroup(server.Get(), L"forced");
    ComPtr<IEnumUnknown> groups;
    ASSERT_EQ(
        server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumUnknown, reinterpret_cast<IUnknown **>(groups.Out())),
        S_OK);
    EXPECT_EQ(server->RemoveGroup(g.handle, TRUE), S_OK);
    EXPECT_EQ(GroupCount(server.Get()), 0u);
    EXPECT_EQ(StateOf(g.group.Get()).hr, E_FAIL);
    EXPECT_EQ(AddGroup(server.Get(), L"forced").hr, S_OK) << "the name is free again";
    // The enumerator's reference reaches the destroyed group's shell safely.
    IUnknown *shell = nullptr;
    ASSERT_EQ(groups->Next(1, &shell, nullptr), S_OK);
    ComPtr<IOPCGroupStateMgt> state;
    ASSERT_EQ(shell->QueryInterface(IID_IOPCGroupStateMgt, reinterpret_cast<void **>(state.Out())), S_OK);
    EXPECT_EQ(StateOf(state.Get()).hr, E_FAIL);
    shell->Release();
}

TEST(Server, GroupEnumeratorsFollowScopeAndInterfaceRules)
{
    auto server = CreateInProcServer();
    IUnknown *unk = nullptr;
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumUnknown, nullptr), E_INVALIDARG);
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IDispatch, &unk), E_NOINTERFACE);
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_PUBLIC, IID_IDispatch, &unk), E_NOINTERFACE);
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_PUBLIC, IID_IEnumString, &unk), E_FAIL);
    EXPECT_EQ(unk, nullptr);

    ComPtr<IEnumUnknown> e;
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumUnknown, reinterpret_cast<IUnknown **>(e.Out())),
              S_FALSE);
    ULONG fetched;
    EXPECT_EQ(e->Next(1, &unk, &fetched), E_FAIL);

    AddGroup(server.Get(), L"b");
    AddGroup(server.Get(), L"C");
    AddGroup(server.Get(), L"a");
    EXPECT_EQ(server->CreateGroupEnumerator(OPC_ENUM_PUBLIC, IID_IEnumUnknown, reinterpret_cast<IUnknown **>(e.Out())),
              S_FALSE);
    EXPECT_EQ(e->Next(1, &unk, &fetched), E_FAIL) << "no public groups";
    for (OPCENUMSCOPE scope : {OPC_ENUM_ALL, OPC_ENUM_PRIVATE, OPC_ENUM_ALL_CONNECTIONS, OPCENUMSCOPE(77)})
        EXPECT_EQ(GroupNames(server.Get(), scope), (std::vector<std::wstring>{L"C", L"a", L"b"}));

    ASSERT_EQ(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumUnknown, reinterpret_cast<IUnknown **>(e.Out())),
              S_OK);
    AddGroup(server.Get(), L"later");
    IUnknown *all[8] = {};
    EXPECT_EQ(e->Next(8, all, &fetched), S_FALSE);
    EXPECT_EQ(fetched, 3u) << "a snapshot";
    for (ULONG i = 0; i < fetched; ++i)
        all[i]->Release();
}

TEST(Server, ReleasingTheServerRemovesItsGroups)
{
    LONG locks = ComModule::LockCount();
    ComPtr<IOPCGroupStateMgt> kept;
    {
        auto server = CreateInProcServer();
        kept = AddGroup(server.Get(), L"kept").group;
        AddGroup(server.Get(), L"dropped");
    }
    EXPECT_EQ(StateOf(kept.Get()).hr, E_FAIL);
    kept.Reset();
    EXPECT_EQ(ComModule::LockCount(), locks);
}

TEST(Server, ConcurrentClientsNeverCorruptTheRegistry)
{
    auto server = CreateInProcServer();
    long failuresBefore = AssertionFailureCount();
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&server, t] {
            CoInitializeEx(nullptr, COINIT_MULTITHREADED);
            for (int i = 0; i < 200; ++i) {
                std::wstring name = L"g" + std::to_wstring(t) + L"_" + std::to_wstring(i % 7);
                auto g = AddGroup(server.Get(), name.c_str());
                GroupNames(server.Get());
                if (SUCCEEDED(g.hr))
                    server->RemoveGroup(g.handle, i % 2 == 0);
                AddGroup(server.Get(), L"shared");
                ComPtr<IOPCGroupStateMgt> shared;
                server->GetGroupByName(L"shared", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(shared.Out()));
                if (shared)
                    server->RemoveGroup(StateOf(shared.Get()).server, i % 3 == 0);
            }
            CoUninitialize();
        });
    }
    for (auto &thread : threads)
        thread.join();
    EXPECT_EQ(AssertionFailureCount(), failuresBefore);
    EXPECT_EQ(GroupCount(server.Get()), GroupNames(server.Get()).size());
}

TEST(Server, RemovalWaitsUntilTheGroupHasNoPendingWork)
{
    auto server = CreateInProcServer();
    auto g = AddGroup(server.Get(), L"busy", 100, FALSE); // inactive: no scanner entry
    // The in-process test knows the group's class behind its interface.
    auto *group = static_cast<COPCGroup *>(g.group.Get());
    group->AddWork();
    group->AddWork();
    std::atomic<bool> removed{false};
    std::thread remover([&] {
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        EXPECT_EQ(server->RemoveGroup(g.handle, FALSE), OPC_S_INUSE);
        removed = true;
        CoUninitialize();
    });
    Sleep(200);
    EXPECT_FALSE(removed) << "removal waits for the idle event";
    group->ReleaseWork();
    Sleep(100);
    EXPECT_FALSE(removed);
    group->ReleaseWork();
    remover.join();
    EXPECT_TRUE(removed);
}

TEST(Server, CloningWhileTheServerIsReleasedNeverUsesAFreedServer)
{
    LONG locks = ComModule::LockCount();
    for (int round = 0; round < 20; ++round) {
        auto server = CreateInProcServer();
        auto g = AddGroup(server.Get(), L"source");
        std::atomic<bool> stop{false};
        std::atomic<int> made{0};
        std::thread cloner([&] {
            CoInitializeEx(nullptr, COINIT_MULTITHREADED);
            while (!stop) {
                ComPtr<IUnknown> clone;
                g.group->CloneGroup(L"", IID_IUnknown, clone.Out());
                ++made;
            }
            CoUninitialize();
        });
        while (made < 20)
            Sleep(0);
        server.Reset(); // final release while clones are being made
        Sleep(5);
        stop = true;
        cloner.join();
        g.group.Reset();
    }
    EXPECT_EQ(ComModule::LockCount(), locks) << "every clone made before the release went with its server";
}
