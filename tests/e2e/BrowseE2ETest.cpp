// Browsing the simulated default network from a client process.
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

namespace {
std::vector<std::wstring> Names(IOPCBrowseServerAddressSpace *browse, OPCBROWSETYPE type, const wchar_t *filter,
                                DWORD access = 0)
{
    std::vector<std::wstring> out;
    ComPtr<IEnumString> e;
    if (FAILED(browse->BrowseOPCItemIDs(type, filter, VT_EMPTY, access, e.Out())) || !e)
        return out;
    LPOLESTR batch[8];
    ULONG fetched = 0;
    HRESULT hr;
    do {
        hr = e->Next(8, batch, &fetched);
        for (ULONG i = 0; i < fetched; ++i) {
            out.emplace_back(batch[i]);
            CoTaskMemFree(batch[i]);
        }
    } while (hr == S_OK);
    return out;
}

bool Contains(const std::vector<std::wstring> &v, const std::wstring &s)
{
    return std::find(v.begin(), v.end(), s) != v.end();
}
} // namespace

TEST(BrowseE2E, BrowsesDownAndUpAndAddsWhatItFound)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        ComPtr<IOPCBrowseServerAddressSpace> browse;
        ASSERT_EQ(server.As(browse), S_OK);

        auto roots = Names(browse.Get(), OPC_BRANCH, L"");
        ASSERT_TRUE(Contains(roots, L"Network"));
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"Network"), S_OK);
        auto machines = Names(browse.Get(), OPC_BRANCH, L"");
        EXPECT_TRUE(Contains(machines, L"PLANT7"));
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"PLANT7"), S_OK);
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"control"), S_OK);
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"Boiler"), S_OK);
        auto leaves = Names(browse.Get(), OPC_LEAF, L"");
        EXPECT_TRUE(Contains(leaves, L"temperature-Boiler temperature"));
        EXPECT_EQ(Names(browse.Get(), OPC_LEAF, L"", OPC_WRITEABLE), (std::vector<std::wstring>{L"burner", L"mode"}));
        LPWSTR id = nullptr;
        ASSERT_EQ(browse->GetItemID(const_cast<wchar_t *>(L"temperature-Boiler temperature"), &id), S_OK);
        std::wstring temperature = id;
        CoTaskMemFree(id);
        EXPECT_EQ(temperature, L"\\\\PLANT7\\control\\Boiler.temperature");
        for (int i = 0; i < 4; ++i)
            EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_UP, L""), S_OK);
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_UP, L""), E_FAIL) << "back at the root";

        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc1"), S_OK);
        auto flat = Names(browse.Get(), OPC_FLAT, L"*e");
        EXPECT_TRUE(Contains(flat, L"\\\\.\\proc1\\Waveform.sine"));
        EXPECT_TRUE(Contains(flat, L"\\\\.\\proc1\\Setpoints.temperature"));
        EXPECT_FALSE(Contains(flat, L"\\\\.\\proc1\\Waveform.ramp"));

        // The identifiers found are items the group accepts, with their types.
        ComPtr<IOPCItemMgt> items;
        OPCHANDLE hGroup;
        DWORD rate;
        ASSERT_EQ(server->AddGroup(L"found", TRUE, 100, 0, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        std::vector<OPCITEMDEF> defs(2);
        defs[0] = {};
        defs[0].szItemID = const_cast<wchar_t *>(temperature.c_str());
        defs[1] = {};
        defs[1].szItemID = const_cast<wchar_t *>(L"\\\\PLANT7\\control\\Boiler.mode");
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_EQ(items->AddItems(2, defs.data(), &results, &errors), S_OK);
        EXPECT_EQ(results[0].vtCanonicalDataType, VT_R8);
        EXPECT_EQ(results[0].dwAccessRights, static_cast<DWORD>(OPC_READABLE)) << "rights from the address space";
        EXPECT_EQ(results[1].vtCanonicalDataType, VT_BSTR);
        CoTaskMemFree(results);
        CoTaskMemFree(errors);

        // A member added and removed through the control channel.
        std::string out;
        EXPECT_EQ(RunCadroctl(L"add-member \\\\PLANT7\\control\\Boiler fresh type=bool", out), 0) << out;
        EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\PLANT7\\control\\Boiler"), S_OK);
        EXPECT_TRUE(Contains(Names(browse.Get(), OPC_LEAF, L"f*"), L"fresh"));
        EXPECT_EQ(RunCadroctl(L"remove-member \\\\PLANT7\\control\\Boiler.fresh", out), 0) << out;
        EXPECT_FALSE(Contains(Names(browse.Get(), OPC_LEAF, L"f*"), L"fresh"));
    }
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}
