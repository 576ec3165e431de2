// Items across the process boundary: the server runs out of process against
// its simulated network, which cadroctl drives from a third process.
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <functional>
#include <string>
#include <vector>

namespace {
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature";

struct Row {
    HRESULT hr = E_FAIL;
    VARIANT value;
    WORD quality = 0xFFFF;
    Row() { VariantInit(&value); }
    ~Row() { VariantClear(&value); }
};

class ItemsE2E : public testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(WaitForNoServerProcess(20000));
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        OPCHANDLE handle;
        DWORD rate;
        ASSERT_EQ(server->AddGroup(L"e2e", TRUE, 100, 1, nullptr, nullptr, 0, &handle, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        ASSERT_EQ(items.As(io), S_OK);
    }
    void TearDown() override
    {
        io.Reset();
        items.Reset();
        server.Reset();
        EXPECT_TRUE(WaitForNoServerProcess(20000)) << "the server did not exit";
    }

    std::vector<OPCHANDLE> Add(const std::vector<std::pair<const wchar_t *, VARTYPE>> &ids, BOOL active = TRUE)
    {
        std::vector<OPCITEMDEF> defs;
        for (size_t i = 0; i < ids.size(); ++i) {
            OPCITEMDEF d = {};
            d.szItemID = const_cast<wchar_t *>(ids[i].first);
            d.bActive = active;
            d.hClient = static_cast<OPCHANDLE>(i + 1);
            d.vtRequestedDataType = ids[i].second;
            defs.push_back(d);
        }
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        EXPECT_EQ(items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors), S_OK);
        std::vector<OPCHANDLE> handles;
        for (size_t i = 0; i < defs.size(); ++i)
            handles.push_back(results ? results[i].hServer : 0);
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
        return handles;
    }

    void Read(OPCDATASOURCE source, const std::vector<OPCHANDLE> &handles, std::vector<Row> &rows)
    {
        rows = std::vector<Row>(handles.size());
        OPCITEMSTATE *states = nullptr;
        HRESULT *errors = nullptr;
        HRESULT hr = io->Read(source, static_cast<DWORD>(handles.size()), const_cast<OPCHANDLE *>(handles.data()),
                              &states, &errors);
        ASSERT_TRUE(SUCCEEDED(hr)) << std::hex << hr;
        for (size_t i = 0; i < handles.size(); ++i) {
            rows[i].hr = errors[i];
            rows[i].quality = states[i].wQuality;
            rows[i].value = states[i].vDataValue;
        }
        CoTaskMemFree(states);
        CoTaskMemFree(errors);
    }

    HRESULT WriteOne(OPCHANDLE handle, VARIANT value)
    {
        HRESULT *errors = nullptr;
        HRESULT hr = io->Write(1, &handle, &value, &errors);
        HRESULT item = errors ? errors[0] : hr;
        CoTaskMemFree(errors);
        return item;
    }

    // Reads until pred holds (the network's echo takes a moment).
    bool ReadUntil(OPCHANDLE handle, const std::function<bool(const Row &)> &pred)
    {
        for (int i = 0; i < 100; ++i) {
            std::vector<Row> rows;
            Read(OPC_DS_DEVICE, {handle}, rows);
            if (pred(rows[0]))
                return true;
            Sleep(50);
        }
        return false;
    }

    ComPtr<IOPCServer> server;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IOPCSyncIO> io;
};
} // namespace

TEST_F(ItemsE2E, ReadsEveryTypeFromCacheAndDeviceWithConversions)
{
    auto h = Add({{kTemperature, VT_EMPTY},
                  {L"\\\\.\\proc1\\Setpoints.enabled", VT_EMPTY},
                  {L"\\\\.\\proc1\\Setpoints.label", VT_EMPTY},
                  {L"\\\\.\\proc1\\Setpoints.code", VT_EMPTY},
                  {kTemperature, VT_I4},
                  {kTemperature, VT_BSTR}});
    auto inactive = Add({{kTemperature, VT_EMPTY}}, FALSE);
    std::vector<Row> rows;
    Read(OPC_DS_CACHE, h, rows);
    for (const Row &r : rows) {
        EXPECT_EQ(r.hr, S_OK);
        EXPECT_EQ(r.quality, OPC_QUALITY_GOOD);
    }
    EXPECT_EQ(V_VT(&rows[0].value), VT_R8);
    EXPECT_EQ(V_R8(&rows[0].value), 21.5);
    EXPECT_EQ(V_VT(&rows[1].value), VT_BOOL);
    EXPECT_EQ(V_BOOL(&rows[1].value), VARIANT_TRUE);
    EXPECT_EQ(V_VT(&rows[2].value), VT_BSTR);
    EXPECT_STREQ(V_BSTR(&rows[2].value), L"Line 1");
    EXPECT_EQ(V_VT(&rows[3].value), VT_BSTR) << "narrow text reaches clients as a BSTR";
    EXPECT_STREQ(V_BSTR(&rows[3].value), L"A-17");
    EXPECT_EQ(V_VT(&rows[4].value), VT_I4) << "a VT_R8 member requested as VT_I4";
    EXPECT_EQ(V_I4(&rows[4].value), 22);
    EXPECT_EQ(V_VT(&rows[5].value), VT_BSTR) << "a VT_R8 member requested as VT_BSTR";
    EXPECT_STREQ(V_BSTR(&rows[5].value), L"21.5");

    Read(OPC_DS_CACHE, inactive, rows);
    EXPECT_EQ(rows[0].quality, OPC_QUALITY_OUT_OF_SERVICE) << "inactive item, cache read";
    Read(OPC_DS_DEVICE, inactive, rows);
    EXPECT_EQ(rows[0].quality, OPC_QUALITY_GOOD) << "inactive item, device read";
}

TEST_F(ItemsE2E, PublishedQualityWritesAndRights)
{
    auto h = Add({{kTemperature, VT_EMPTY}, {L"\\\\.\\proc1\\Setpoints.limit", VT_EMPTY}});
    std::vector<Row> rows;
    Read(OPC_DS_DEVICE, h, rows);
    ASSERT_EQ(rows[0].hr, S_OK);

    // A bad-quality value published through the network's control channel.
    std::string out;
    EXPECT_EQ(RunCadroctl(std::wstring(L"publish ") + kTemperature + L" 30 quality=bad", out), 0) << out;
    EXPECT_TRUE(ReadUntil(
        h[0], [](const Row &r) { return r.hr == S_OK && r.quality == OPC_QUALITY_BAD && V_R8(&r.value) == 30.0; }));

    // A write comes back from the network as the new value, good again.
    VARIANT v;
    V_VT(&v) = VT_R8;
    V_R8(&v) = 25.25;
    EXPECT_EQ(WriteOne(h[0], v), S_OK);
    EXPECT_TRUE(ReadUntil(
        h[0], [](const Row &r) { return r.hr == S_OK && r.quality == OPC_QUALITY_GOOD && V_R8(&r.value) == 25.25; }));

    // A read-only member refuses writes once the network has said so.
    HRESULT rights = S_OK;
    for (int i = 0; i < 100 && rights != OPC_E_BADRIGHTS; ++i, Sleep(20))
        rights = WriteOne(h[1], v);
    EXPECT_EQ(rights, OPC_E_BADRIGHTS);
    Read(OPC_DS_DEVICE, {h[1]}, rows);
    EXPECT_EQ(V_R8(&rows[0].value), 100.0);
}

TEST_F(ItemsE2E, AMemberThatNeverDeliversIsUnknownAfterTheWait)
{
    auto h = Add({{L"\\\\.\\proc1\\Setpoints.never", VT_EMPTY}});
    std::vector<Row> rows;
    DWORD start = GetTickCount();
    Read(OPC_DS_DEVICE, h, rows);
    DWORD elapsed = GetTickCount() - start;
    EXPECT_EQ(rows[0].hr, OPC_E_UNKNOWNITEMID);
    EXPECT_EQ(V_VT(&rows[0].value), VT_EMPTY);
    EXPECT_GE(elapsed, 2500u) << "the read waited for a first value";
    EXPECT_LT(elapsed, 20000u);

    OPCITEMDEF unknown = {};
    unknown.szItemID = const_cast<wchar_t *>(L"\\\\.\\proc1\\Nowhere.x");
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    EXPECT_EQ(items->AddItems(1, &unknown, &results, &errors), S_FALSE);
    EXPECT_EQ(errors[0], OPC_E_UNKNOWNITEMID);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
}
