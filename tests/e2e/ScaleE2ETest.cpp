// Plant-size AddItems across the process boundary: 20,000 distinct items of
// one network file, every result with its member's own type and rights.
#include "ComPtr.h"
#include "ItemDefinitions.h"
#include "ServerProcess.h"
#include "TestNetwork.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

// Member i: its type and access follow i, so each result can be checked.
const char *const kTypes[] = {"number", "bool", "wtext"};
const VARTYPE kCanonical[] = {VT_R8, VT_BOOL, VT_BSTR};
const char *const kAccess[] = {"rw", "r", "w"};
const DWORD kRights[] = {3, 1, 2};

} // namespace

TEST(ScaleE2E, AddItemsOfTwentyThousandDistinctItemsGivesEachItsTypeAndRights)
{
    const DWORD count = 20000;
    std::string text = "machine $HOST\nprocess plant\n";
    for (DWORD o = 0; o < 4; ++o) {
        text += "object Area" + std::to_string(o) + "\\Unit\n";
        for (DWORD i = o; i < count; i += 4)
            text += "member tag" + std::to_string(i) + " type=" + kTypes[i % 3] + " access=" + kAccess[i % 3] + "\n";
    }
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    TestNetwork network(L"scale_e2e_network.txt", text);
    ASSERT_TRUE(network.Ok());
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        ASSERT_EQ(network.Load(), 0);
        OPCHANDLE group = 0;
        DWORD rate = 0;
        ComPtr<IOPCItemMgt> items;
        ASSERT_EQ(server->AddGroup(L"plant", TRUE, 1000, 0, nullptr, nullptr, 0, &group, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        std::vector<std::wstring> ids;
        for (DWORD i = 0; i < count; ++i)
            ids.push_back(L"\\\\.\\plant\\Area" + std::to_wstring(i % 4) + L"\\Unit.tag" + std::to_wstring(i));
        ids.push_back(L"\\\\.\\plant\\Area0\\Unit.nothing");
        std::vector<OPCITEMDEF> defs = ActiveDefinitions(ids);
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_EQ(items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors), S_FALSE);
        ASSERT_TRUE(results && errors);
        int wrong = 0;
        std::vector<OPCHANDLE> handles;
        for (DWORD i = 0; i < count && wrong < 5; ++i) {
            handles.push_back(results[i].hServer);
            if (errors[i] != S_OK || results[i].vtCanonicalDataType != kCanonical[i % 3] ||
                results[i].dwAccessRights != kRights[i % 3] || results[i].hServer == 0) {
                ADD_FAILURE() << "item " << i << ": 0x" << std::hex << errors[i] << " type "
                              << results[i].vtCanonicalDataType << " rights " << results[i].dwAccessRights;
                ++wrong;
            }
        }
        EXPECT_EQ(errors[count], static_cast<HRESULT>(0xC0040007)) << "OPC_E_UNKNOWNITEMID for the missing tag";
        CoTaskMemFree(results);
        CoTaskMemFree(errors);

        // The handles are the group's: removing them all succeeds once.
        HRESULT *removed = nullptr;
        EXPECT_EQ(items->RemoveItems(static_cast<DWORD>(handles.size()), handles.data(), &removed), S_OK);
        CoTaskMemFree(removed);
        items.Reset();
        EXPECT_EQ(server->RemoveGroup(group, FALSE), S_OK);
    }
    EXPECT_TRUE(WaitForNoServerProcess(30000)) << "the server did not exit";
}
