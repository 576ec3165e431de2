// IOPCItemProperties for known leaves, branches, unlisted and invalid
// identifiers of the simulated default network.
#include "InProcServer.h"
#include "OpcErrors.h"

#include <chrono>

namespace {
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature";
const wchar_t kNever[] = L"\\\\.\\proc1\\Setpoints.never";

class PropertiesTest : public testing::Test {
protected:
    void SetUp() override
    {
        server = CreateInProcServer();
        ASSERT_EQ(server.As(props), S_OK);
    }
    struct Available {
        HRESULT hr;
        std::vector<DWORD> ids;
        std::vector<VARTYPE> types;
        std::vector<std::wstring> descriptions;
    };
    Available Query(const wchar_t *id)
    {
        Available a;
        DWORD n = 0;
        DWORD *ids = nullptr;
        LPWSTR *descriptions = nullptr;
        VARTYPE *types = nullptr;
        a.hr = props->QueryAvailableProperties(const_cast<wchar_t *>(id), &n, &ids, &descriptions, &types);
        for (DWORD i = 0; i < n; ++i) {
            a.ids.push_back(ids[i]);
            a.types.push_back(types[i]);
            a.descriptions.push_back(descriptions[i]);
            CoTaskMemFree(descriptions[i]);
        }
        CoTaskMemFree(ids);
        CoTaskMemFree(descriptions);
        CoTaskMemFree(types);
        return a;
    }
    HRESULT Get(const wchar_t *id, std::vector<DWORD> which, std::vector<VARIANT> &values, std::vector<HRESULT> &errors)
    {
        VARIANT *v = nullptr;
        HRESULT *e = nullptr;
        HRESULT hr =
            props->GetItemProperties(const_cast<wchar_t *>(id), static_cast<DWORD>(which.size()), which.data(), &v, &e);
        values.assign(v, v ? v + which.size() : v);
        errors.assign(e, e ? e + which.size() : e);
        CoTaskMemFree(v);
        CoTaskMemFree(e);
        return hr;
    }
    ComPtr<IOPCServer> server;
    ComPtr<IOPCItemProperties> props;
};
} // namespace

TEST_F(PropertiesTest, AvailablePropertiesFollowTheKindOfIdentifier)
{
    Available leaf = Query(kTemperature);
    EXPECT_EQ(leaf.hr, S_OK);
    EXPECT_EQ(leaf.ids, (std::vector<DWORD>{1, 2, 3, 4, 5, 6, 101}));
    EXPECT_EQ(leaf.types, (std::vector<VARTYPE>{VT_I2, VT_R8, VT_I2, VT_DATE, VT_I4, VT_R4, VT_BSTR}));
    EXPECT_EQ(leaf.descriptions[0], L"Item Canonical Data Type");
    EXPECT_EQ(leaf.descriptions[6], L"Item Description");
    Available text = Query(L"\\\\.\\proc1\\Setpoints.label");
    EXPECT_EQ(text.types[1], VT_BSTR) << "property 2 has the node's type";
    Available unlisted = Query(L"\\\\.\\proc1\\Nowhere.x");
    EXPECT_EQ(unlisted.ids, (std::vector<DWORD>{1, 2, 3, 4, 5, 6}));
    EXPECT_EQ(unlisted.types[1], VT_R8);
    Available branch = Query(L"\\\\.\\proc1");
    EXPECT_EQ(branch.ids, std::vector<DWORD>{101});
    EXPECT_EQ(Query(L"\\\\.\\p\\'open").hr, OPC_E_UNKNOWNITEMID);
    DWORD n;
    DWORD *ids;
    LPWSTR *d;
    VARTYPE *t;
    EXPECT_EQ(props->QueryAvailableProperties(nullptr, &n, &ids, &d, &t), E_INVALIDARG);
}

TEST_F(PropertiesTest, ValuesComeFromTheTreeAndOneDeviceRead)
{
    std::vector<VARIANT> v;
    std::vector<HRESULT> e;
    ASSERT_EQ(Get(kTemperature, {1, 2, 3, 4, 5, 6, 101, 100}, v, e), S_OK);
    EXPECT_EQ(V_I2(&v[0]), VT_R8);
    EXPECT_EQ(V_VT(&v[1]), VT_R8);
    EXPECT_EQ(V_R8(&v[1]), 21.5);
    EXPECT_EQ(V_I2(&v[2]), OPC_QUALITY_GOOD);
    EXPECT_EQ(V_VT(&v[3]), VT_DATE);
    EXPECT_EQ(V_I4(&v[4]), 3);
    EXPECT_EQ(V_R4(&v[5]), 1.0f);
    EXPECT_STREQ(V_BSTR(&v[6]), L"temperature");
    EXPECT_EQ(e[7], OPC_E_INVALID_PID);
    for (VARIANT &x : v)
        VariantClear(&x);

    ASSERT_EQ(Get(L"\\\\.\\proc1", {101, 1}, v, e), S_OK);
    EXPECT_STREQ(V_BSTR(&v[0]), L"proc1");
    EXPECT_EQ(e[1], OPC_E_INVALID_PID);
    VariantClear(&v[0]);

    // Property 6 needs no read, even for a member that never delivers.
    auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(Get(kNever, {6, 5}, v, e), S_OK);
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
    EXPECT_EQ(V_R4(&v[0]), 1.0f);
    EXPECT_EQ(V_I4(&v[1]), 1);
    // Its value properties wait for the read and fail.
    EXPECT_EQ(Get(kNever, {2, 3, 6}, v, e), S_FALSE);
    EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(2500));
    EXPECT_EQ(e[0], E_FAIL);
    EXPECT_EQ(e[2], S_OK);

    // An unlisted item that the network does not know fails as a whole.
    EXPECT_EQ(Get(L"\\\\.\\proc1\\Nowhere.x", {1, 2}, v, e), E_FAIL);
    EXPECT_TRUE(v.empty());
    ASSERT_EQ(Get(L"\\\\.\\proc1\\Nowhere.x", {6}, v, e), S_OK);
    EXPECT_EQ(Get(L"x", {1}, v, e), OPC_E_UNKNOWNITEMID);
    EXPECT_EQ(Get(kTemperature, {}, v, e), E_INVALIDARG);
}

TEST_F(PropertiesTest, LookupItemIdsAnswersOnlyTheValueProperty)
{
    DWORD which[] = {2, 3, 999};
    LPWSTR *ids = nullptr;
    HRESULT *errors = nullptr;
    ASSERT_EQ(props->LookupItemIDs(const_cast<wchar_t *>(kTemperature), 3, which, &ids, &errors), S_FALSE);
    EXPECT_STREQ(ids[0], kTemperature);
    EXPECT_EQ(ids[1], nullptr);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], E_FAIL);
    EXPECT_EQ(errors[2], OPC_E_INVALID_PID);
    CoTaskMemFree(ids[0]);
    CoTaskMemFree(ids);
    CoTaskMemFree(errors);
    EXPECT_EQ(props->LookupItemIDs(const_cast<wchar_t *>(L"\\\\.\\p\\'open"), 3, which, &ids, &errors),
              OPC_E_INVALIDITEMID);
}
