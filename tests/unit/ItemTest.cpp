// COPCItem on its own: a fake group, no network (updates are fed by hand).
#include "FakeGroup.h"
#include "OPCCadroClient.h"
#include "OPCItem.h"
#include "OpcErrors.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

namespace {
OPCITEMDEF Def(const wchar_t *id, VARTYPE requested = VT_EMPTY, BOOL active = TRUE)
{
    OPCITEMDEF d = {};
    d.szItemID = const_cast<wchar_t *>(id);
    d.szAccessPath = const_cast<wchar_t *>(L"");
    d.bActive = active;
    d.hClient = 77;
    d.vtRequestedDataType = requested;
    return d;
}

void Feed(COPCItem &item, double value, int32_t error = 0, DWORD timeLow = 1000)
{
    CadroValue v = {};
    v.type = kCadroNumber;
    v.number = value;
    item.OnDataUpdate(kCadroHasValue | kCadroHasQuality | kCadroHasTime, v, error, FILETIME{timeLow, 1});
}

struct Check {
    HRESULT hr;
    bool changed;
    CVariant value;
    WORD quality;
    FILETIME time;
};

void CheckOf(COPCItem &item, Check &c)
{
    OPCHANDLE client;
    c.hr = item.CheckChanged(0.0, &client, c.value.Get(), &c.quality, &c.time, &c.changed);
}
} // namespace

TEST(Item, InitChoosesCanonicalTypesForUnknownItems)
{
    FakeGroup group;
    struct Case {
        VARTYPE requested;
        VARTYPE canonical;
        HRESULT hr;
    } cases[] = {{VT_I2, VT_R8, S_OK},
                 {VT_BSTR, VT_BSTR, S_OK},
                 {VT_EMPTY, VT_R8, S_OK},
                 {VT_UI4, VT_R8, S_OK},
                 {VT_BOOL, VT_BOOL, S_OK},
                 {VT_DISPATCH, VT_R8, OPC_E_BADTYPE},
                 {VT_I4 | VT_ARRAY, VT_R8, OPC_E_BADTYPE}};
    for (const Case &c : cases) {
        auto made = COPCItem::Create(Def(L"\\\\.\\p\\o.m", c.requested));
        COPCItem &item = *made;
        OPCITEMRESULT result;
        EXPECT_EQ(item.Init(&group, Def(L"\\\\.\\p\\o.m", c.requested), result), c.hr) << c.requested;
        if (SUCCEEDED(c.hr)) {
            EXPECT_EQ(result.vtCanonicalDataType, c.canonical) << c.requested;
            EXPECT_EQ(result.dwAccessRights, 3u);
            EXPECT_NE(result.hServer, 0u);
        }
    }
    OPCITEMRESULT result;
    EXPECT_EQ(COPCItem::Create(Def(L""))->Init(&group, Def(L""), result), OPC_E_INVALIDITEMID);
    EXPECT_EQ(result.hServer, 0u);
    EXPECT_EQ(COPCItem::Create(Def(nullptr))->Init(&group, Def(nullptr), result), OPC_E_INVALIDITEMID);

    // The texts live in the item's own block (a byte a character when both
    // are ASCII): long ones, a null access path and characters beyond ASCII
    // in either text come back intact.
    std::wstring longId = L"\\\\.\\p\\o." + std::wstring(10000, L'x');
    OPCITEMDEF def = Def(longId.c_str());
    for (const wchar_t *path : {L"path", static_cast<const wchar_t *>(nullptr), L"Pfad\u00e4\u4e2d"}) {
        def.szAccessPath = const_cast<wchar_t *>(path);
        auto item = COPCItem::Create(def);
        ASSERT_EQ(item->Init(&group, def, result), S_OK);
        OPCITEMATTRIBUTES attributes;
        ASSERT_EQ(item->GetAttributes(attributes, malloc), S_OK);
        EXPECT_EQ(attributes.szItemID, longId);
        EXPECT_STREQ(attributes.szAccessPath, path ? path : L"");
        free(attributes.szItemID);
        free(attributes.szAccessPath);
    }
    std::wstring wideId = L"\\\\.\\p\\\u00d6fen.\u00fc";
    def = Def(wideId.c_str());
    auto item = COPCItem::Create(def);
    ASSERT_EQ(item->Init(&group, def, result), S_OK);
    OPCITEMATTRIBUTES attributes;
    ASSERT_EQ(item->GetAttributes(attributes, malloc), S_OK);
    EXPECT_EQ(attributes.szItemID, wideId);
    EXPECT_STREQ(attributes.szAccessPath, L"");
    free(attributes.szItemID);
    free(attributes.szAccessPath);
}

TEST(Item, ChangesFollowQualityAndValueButNotTime)
{
    FakeGroup group;
    auto made = COPCItem::Create(Def(L"\\\\.\\p\\o.m"));
    COPCItem &item = *made;
    OPCITEMRESULT result;
    ASSERT_EQ(item.Init(&group, Def(L"\\\\.\\p\\o.m"), result), S_OK);
    EXPECT_EQ(group.active.size(), 1u);

    Check c;
    CheckOf(item, c);
    EXPECT_TRUE(c.changed) << "first scan: GOOD, VT_EMPTY differs from the initial BAD";
    EXPECT_EQ(c.quality, OPC_QUALITY_GOOD);
    CheckOf(item, c);
    EXPECT_FALSE(c.changed);

    Feed(item, 1.5, 0, 100);
    CheckOf(item, c);
    EXPECT_TRUE(c.changed);
    EXPECT_EQ(V_R8(c.value.Get()), 1.5);
    Feed(item, 1.5, 0, 200); // same value and quality, another time stamp
    CheckOf(item, c);
    EXPECT_FALSE(c.changed) << "time stamps are not compared";
    Feed(item, 1.5, 1, 300);
    CheckOf(item, c);
    EXPECT_TRUE(c.changed) << "a quality change alone is a change";
    EXPECT_EQ(c.quality, OPC_QUALITY_BAD);

    // A read hands the value over: the next scan has nothing to report.
    Feed(item, 2.5);
    OPCHANDLE client;
    CVariant value;
    WORD quality;
    FILETIME time;
    EXPECT_EQ(item.Read(OPC_DS_CACHE, &client, value.Get(), &quality, &time), S_OK);
    EXPECT_EQ(client, 77u);
    EXPECT_EQ(V_R8(value.Get()), 2.5);
    CheckOf(item, c);
    EXPECT_FALSE(c.changed);

    // Deactivation in an active group puts the item out of service; after
    // reactivation the next scan reports it again.
    EXPECT_EQ(item.SetActive(FALSE), S_OK);
    EXPECT_TRUE(group.active.empty());
    EXPECT_EQ(item.Read(OPC_DS_CACHE, &client, value.Get(), &quality, &time), S_OK);
    EXPECT_EQ(quality, OPC_QUALITY_OUT_OF_SERVICE);
    EXPECT_EQ(item.Read(OPC_DS_DEVICE, &client, value.Get(), &quality, &time), S_OK);
    EXPECT_EQ(quality, OPC_QUALITY_GOOD);
    item.SetActive(FALSE);
    EXPECT_EQ(item.Read(OPC_DS_CACHE, &client, value.Get(), &quality, &time), S_OK);
    item.SetActive(TRUE);
    EXPECT_EQ(group.active.size(), 1u);
    CheckOf(item, c);
    EXPECT_TRUE(c.changed);
    EXPECT_EQ(c.quality, OPC_QUALITY_GOOD);
}

TEST(Item, RequestedTypesConvertAndFailuresPassThrough)
{
    FakeGroup group;
    auto made = COPCItem::Create(Def(L"\\\\.\\p\\o.m", VT_I4));
    COPCItem &item = *made;
    OPCITEMRESULT result;
    ASSERT_EQ(item.Init(&group, Def(L"\\\\.\\p\\o.m", VT_I4), result), S_OK);
    Feed(item, 41.6);
    OPCHANDLE client;
    CVariant value;
    WORD quality;
    FILETIME time;
    EXPECT_EQ(item.Read(OPC_DS_DEVICE, &client, value.Get(), &quality, &time), S_OK);
    EXPECT_EQ(V_VT(value.Get()), VT_I4);
    EXPECT_EQ(V_I4(value.Get()), 42);
    item.SetRequestedType(VT_I2);
    Feed(item, 1e10);
    EXPECT_EQ(item.Read(OPC_DS_DEVICE, &client, value.Get(), &quality, &time), DISP_E_OVERFLOW);
    EXPECT_EQ(V_VT(value.Get()), VT_EMPTY);
    item.SetRequestedType(VT_BSTR);
    Feed(item, 3.0);
    EXPECT_EQ(item.Read(OPC_DS_DEVICE, &client, value.Get(), &quality, &time), S_OK);
    EXPECT_STREQ(V_BSTR(value.Get()), L"3");
    // Every VARTYPE as a requested type: a result, never a crash.
    for (unsigned vt = 0; vt <= 0xFFFF; vt += 13) {
        item.SetRequestedType(static_cast<VARTYPE>(vt));
        item.Read(OPC_DS_DEVICE, &client, value.Get(), &quality, &time);
    }
}

TEST(Item, WritesCheckRightsAndNeedANetwork)
{
    FakeGroup group;
    auto made = COPCItem::Create(Def(L"\\\\.\\p\\o.m"));
    COPCItem &item = *made;
    OPCITEMRESULT result;
    ASSERT_EQ(item.Init(&group, Def(L"\\\\.\\p\\o.m"), result), S_OK);
    CVariant v;
    V_VT(v.Get()) = VT_I4;
    V_I4(v.Get()) = 5;
    EXPECT_EQ(item.Write(v.Value()), E_FAIL) << "no data item without a network";
    CVariant text;
    V_VT(text.Get()) = VT_BSTR;
    V_BSTR(text.Get()) = SysAllocString(L"not a number");
    EXPECT_EQ(item.Write(text.Value()), DISP_E_TYPEMISMATCH);

    CadroAttributes readOnly = {};
    readOnly.mask = 0x02 | 0x04;
    readOnly.dataType = kCadroNumber;
    readOnly.access = 1;
    item.OnAttributesUpdate(readOnly);
    EXPECT_EQ(item.AccessRights(), OPC_READABLE);
    EXPECT_EQ(item.Write(v.Value()), OPC_E_BADRIGHTS);

    CadroAttributes writeOnly = readOnly;
    writeOnly.access = 2;
    item.OnAttributesUpdate(writeOnly);
    Check c;
    CheckOf(item, c);
    EXPECT_EQ(c.hr, OPC_E_BADRIGHTS);
    EXPECT_FALSE(c.changed);
}

TEST(RealTimeClient, ExpandsOnlyALeadingLocalMachine)
{
    BSTR host = nullptr;
    GetHostMachineName(&host);
    std::wstring name = host;
    SysFreeString(host);
    wchar_t *expanded = ExpandLocalMachine(L"\\\\.\\a\\b");
    ASSERT_NE(expanded, nullptr);
    EXPECT_EQ(std::wstring(expanded), L"\\\\" + name + L"\\a\\b");
    cdd_free(expanded);
    for (const wchar_t *unchanged : {L"\\\\.", L"\\\\.x\\a", L"\\\\HOST\\a", L"\\\\.a\\b", L""})
        EXPECT_EQ(ExpandLocalMachine(unchanged), nullptr) << unchanged;
}
