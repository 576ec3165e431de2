#include "InProcServer.h"
#include "OpcErrors.h"

#include <cmath>

namespace {
class GroupStateTest : public testing::Test {
protected:
    void SetUp() override
    {
        server = CreateInProcServer();
        FLOAT deadband = 12.5f;
        LONG bias = 60;
        added = AddGroup(server.Get(), L"G", 500, TRUE, &deadband, &bias);
        ASSERT_EQ(added.hr, S_OK);
        group = added.group;
    }

    ComPtr<IOPCServer> server;
    AddedGroup added;
    ComPtr<IOPCGroupStateMgt> group;
};
} // namespace

TEST_F(GroupStateTest, GetStateNeedsEveryPointer)
{
    DWORD rate, lcid;
    BOOL active;
    LPWSTR name;
    LONG bias;
    FLOAT deadband;
    OPCHANDLE client, srv;
    EXPECT_EQ(group->GetState(nullptr, &active, &name, &bias, &deadband, &lcid, &client, &srv), E_INVALIDARG);
    EXPECT_EQ(group->GetState(&rate, &active, nullptr, &bias, &deadband, &lcid, &client, &srv), E_INVALIDARG);
    EXPECT_EQ(group->GetState(&rate, &active, &name, &bias, &deadband, &lcid, &client, nullptr), E_INVALIDARG);
    auto s = StateOf(group.Get());
    EXPECT_EQ(s.hr, S_OK);
    EXPECT_EQ(s.rate, 500u);
    EXPECT_TRUE(s.active);
    EXPECT_EQ(s.name, L"G");
    EXPECT_EQ(s.bias, 60);
    EXPECT_EQ(s.deadband, 12.5f);
    EXPECT_EQ(s.client, 42u);
    EXPECT_EQ(s.server, added.handle);
}

TEST_F(GroupStateTest, SetStateRevisesRatesAndLeavesOutputsAloneWhenNotAsked)
{
    DWORD revised = 7777;
    EXPECT_EQ(group->SetState(nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, nullptr), E_INVALIDARG);
    EXPECT_EQ(group->SetState(nullptr, &revised, nullptr, nullptr, nullptr, nullptr, nullptr), S_OK);
    EXPECT_EQ(revised, 7777u) << "no rate requested: the revised rate is not written";
    EXPECT_EQ(StateOf(group.Get()).deadband, 0.0f) << "a null deadband resets it";

    for (DWORD rate : {0u, 9u}) {
        EXPECT_EQ(group->SetState(&rate, &revised, nullptr, nullptr, nullptr, nullptr, nullptr), OPC_S_UNSUPPORTEDRATE);
        EXPECT_EQ(revised, 10u);
    }
    DWORD rate = 10;
    EXPECT_EQ(group->SetState(&rate, &revised, nullptr, nullptr, nullptr, nullptr, nullptr), S_OK);
    rate = 4294967295u;
    EXPECT_EQ(group->SetState(&rate, &revised, nullptr, nullptr, nullptr, nullptr, nullptr), S_OK);
    EXPECT_EQ(revised, 4294967295u);
    EXPECT_EQ(StateOf(group.Get()).rate, 4294967295u);
}

TEST_F(GroupStateTest, InvalidDeadbandChangesNothing)
{
    DWORD rate = 20, revised = 0, lcid = 7;
    BOOL active = FALSE;
    LONG bias = -5;
    OPCHANDLE client = 99;
    for (FLOAT bad : {100.5f, -1.0f, std::nanf("")}) {
        EXPECT_EQ(group->SetState(&rate, &revised, &active, &bias, &bad, &lcid, &client), E_INVALIDARG);
        auto s = StateOf(group.Get());
        EXPECT_EQ(s.rate, 500u);
        EXPECT_TRUE(s.active);
        EXPECT_EQ(s.bias, 60);
        EXPECT_EQ(s.deadband, 12.5f);
        EXPECT_EQ(s.client, 42u);
    }
    FLOAT full = 100.0f;
    EXPECT_EQ(group->SetState(&rate, &revised, &active, &bias, &full, &lcid, &client), S_OK);
    auto s = StateOf(group.Get());
    EXPECT_EQ(s.rate, 20u);
    EXPECT_FALSE(s.active);
    EXPECT_EQ(s.bias, -5);
    EXPECT_EQ(s.deadband, 100.0f);
    EXPECT_EQ(s.lcid, 7u);
    EXPECT_EQ(s.client, 99u);
}

TEST_F(GroupStateTest, SetNameChecksDuplicatesWithinItsServerOnly)
{
    auto other = AddGroup(server.Get(), L"Other");
    EXPECT_EQ(group->SetName(L"G"), OPC_E_DUPLICATENAME) << "its own current name";
    EXPECT_EQ(group->SetName(L"Other"), OPC_E_DUPLICATENAME);
    EXPECT_EQ(group->SetName(L""), E_INVALIDARG);
    EXPECT_EQ(group->SetName(L"Renamed"), S_OK);
    EXPECT_EQ(GroupNames(server.Get()), (std::vector<std::wstring>{L"Other", L"Renamed"}));
    EXPECT_EQ(AddGroup(server.Get(), L"G").hr, S_OK) << "the old name is free";

    auto secondServer = CreateInProcServer();
    auto there = AddGroup(secondServer.Get(), L"X");
    EXPECT_EQ(there.group->SetName(L"Renamed"), S_OK);

    EXPECT_EQ(group->SetName(nullptr), S_OK);
    std::wstring generated = StateOf(group.Get()).name;
    EXPECT_EQ(generated.rfind(L"$Group_", 0), 0u) << generated;
    ComPtr<IOPCGroupStateMgt> found;
    EXPECT_EQ(
        server->GetGroupByName(generated.c_str(), IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(found.Out())),
        S_OK);
}

TEST_F(GroupStateTest, CloneGroupCopiesStateInactiveAndRefusesDuplicates)
{
    ComPtr<IOPCGroupStateMgt> clone;
    EXPECT_EQ(group->CloneGroup(L"Copy", IID_IOPCGroupStateMgt, nullptr), E_INVALIDARG);
    ASSERT_EQ(group->CloneGroup(L"Copy", IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(clone.Out())), S_OK);
    auto s = StateOf(clone.Get());
    auto src = StateOf(group.Get());
    EXPECT_EQ(s.name, L"Copy");
    EXPECT_FALSE(s.active);
    EXPECT_EQ(s.rate, src.rate);
    EXPECT_EQ(s.bias, src.bias);
    EXPECT_EQ(s.deadband, src.deadband);
    EXPECT_EQ(s.lcid, src.lcid);
    EXPECT_EQ(s.client, src.client);
    EXPECT_NE(s.server, src.server);

    DWORD count = GroupCount(server.Get());
    IUnknown *again = reinterpret_cast<IUnknown *>(1);
    EXPECT_EQ(group->CloneGroup(L"Copy", IID_IOPCGroupStateMgt, &again), OPC_E_DUPLICATENAME);
    EXPECT_EQ(again, nullptr);
    EXPECT_EQ(group->CloneGroup(L"Copy2", IID_IDispatch, &again), E_NOINTERFACE);
    EXPECT_EQ(GroupCount(server.Get()), count) << "a failed clone leaves no group behind";

    ComPtr<IOPCGroupStateMgt> generated;
    ASSERT_EQ(group->CloneGroup(nullptr, IID_IOPCGroupStateMgt, reinterpret_cast<IUnknown **>(generated.Out())), S_OK);
    EXPECT_EQ(StateOf(generated.Get()).name.rfind(L"$Group_", 0), 0u);
}

TEST_F(GroupStateTest, AnswersOnlyItsInterfaces)
{
    ComPtr<IUnknown> unk;
    EXPECT_EQ(group->QueryInterface(IID_IOPCItemMgt, reinterpret_cast<void **>(unk.Out())), S_OK);
    // Public groups are not supported.
    const IID IID_IOPCPublicGroupStateMgt = {
        0x39c13a51, 0x011e, 0x11d0, {0x96, 0x75, 0x00, 0x20, 0xaf, 0xd8, 0xad, 0xb3}};
    EXPECT_EQ(group->QueryInterface(IID_IOPCPublicGroupStateMgt, reinterpret_cast<void **>(unk.Out())), E_NOINTERFACE);
    EXPECT_EQ(group->QueryInterface(IID_IDispatch, reinterpret_cast<void **>(unk.Out())), E_NOINTERFACE);
}
