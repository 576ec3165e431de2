// The server list executable through COM from this process, its
// registration beside another installation's list, and opc servers with and
// without it.
#include "ComPtr.h"
#include "OpcRunner.h"
#include "ServerProcess.h"
#include "TaskMem.h"
#include "opccomn.h"

#include <comcat.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

namespace {
const CLSID kServerList = {0x13486d51, 0x4821, 0x11d2, {0xa4, 0x94, 0x3c, 0xb3, 0x06, 0xc1, 0x00, 0x00}};
const CATID kDa10 = {0x63d5f430, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
const CATID kDa20 = {0x63d5f432, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
// A second server, registered in the DA 2.0 category only (no executable:
// the list reads the registry, it never starts the servers it lists).
const CLSID kDa20Only = {0x5b1e7a2f, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
const wchar_t kDa20OnlyKey[] = L"CLSID\\{5B1E7A2F-4C3D-11D3-9A44-00A0C9E2B7F1}";
const wchar_t kDa20OnlyProgId[] = L"Skylarc.ListTestServer.1";
const wchar_t kListKey[] = L"CLSID\\{13486D51-4821-11D2-A494-3CB306C10000}";
const wchar_t kListImage[] = L"SkylarcServerList.exe";
constexpr DWORD kExitWaitMs = 30000;

void WriteText(const std::wstring &path, const wchar_t *value, const std::wstring &text)
{
    HKEY key = nullptr;
    ASSERT_EQ(RegCreateKeyExW(HKEY_CLASSES_ROOT, path.c_str(), 0, nullptr, 0, KEY_WRITE, nullptr, &key, nullptr),
              ERROR_SUCCESS);
    RegSetValueExW(key, value, 0, REG_SZ, reinterpret_cast<const BYTE *>(text.c_str()),
                   static_cast<DWORD>((text.size() + 1) * sizeof(wchar_t)));
    RegCloseKey(key);
}

long RunList(const wchar_t *arguments)
{
    return RunAndWait(L"\"" + BinPath(kListImage) + L"\" " + arguments, 30000);
}

// Registers the second server for the test's life.
class Da20OnlyServer {
public:
    Da20OnlyServer()
    {
        WriteText(kDa20OnlyKey, nullptr, L"Skylarc list test server");
        WriteText(std::wstring(kDa20OnlyKey) + L"\\ProgID", nullptr, kDa20OnlyProgId);
        WriteText(kDa20OnlyProgId, nullptr, L"Skylarc list test server");
        WriteText(std::wstring(kDa20OnlyProgId) + L"\\CLSID", nullptr, L"{5B1E7A2F-4C3D-11D3-9A44-00A0C9E2B7F1}");
        ComPtr<ICatRegister> categories;
        if (SUCCEEDED(CoCreateInstance(CLSID_StdComponentCategoriesMgr, nullptr, CLSCTX_INPROC_SERVER, IID_ICatRegister,
                                       reinterpret_cast<void **>(categories.Out())))) {
            CATID da20 = kDa20;
            categories->RegisterClassImplCategories(kDa20Only, 1, &da20);
        }
    }
    ~Da20OnlyServer()
    {
        RegDeleteTreeW(HKEY_CLASSES_ROOT, kDa20OnlyKey);
        RegDeleteTreeW(HKEY_CLASSES_ROOT, kDa20OnlyProgId);
    }
};

template <class Enumerator> std::vector<CLSID> Drain(Enumerator *classes)
{
    std::vector<CLSID> all;
    CLSID batch[3];
    ULONG fetched = 0;
    while (SUCCEEDED(classes->Next(3, batch, &fetched)) && fetched > 0)
        all.insert(all.end(), batch, batch + std::min<ULONG>(fetched, 3));
    return all;
}

bool Holds(const std::vector<CLSID> &classes, const CLSID &clsid)
{
    return std::any_of(classes.begin(), classes.end(), [&](const CLSID &c) { return IsEqualCLSID(c, clsid); });
}

std::vector<CLSID> ClassesOf(IOPCServerList2 *list, const CATID &category)
{
    CATID wanted = category;
    ComPtr<IOPCEnumGUID> classes;
    EXPECT_EQ(list->EnumClassesOfCategories(1, &wanted, 0, nullptr, classes.Out()), S_OK);
    return classes ? Drain(classes.Get()) : std::vector<CLSID>();
}

class ServerListE2E : public testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(WaitForNoProcess(kListImage, kExitWaitMs));
        ASSERT_TRUE(KeyExists(HKEY_CLASSES_ROOT, kListKey)) << "the prefix has no server list";
    }
    void TearDown() override
    {
        // The list is this build's again, and no copy of it is left.
        RegDeleteTreeW(HKEY_CLASSES_ROOT, kListKey);
        EXPECT_EQ(RunList(L"/RegServer"), 0);
        EXPECT_TRUE(WaitForNoProcess(kListImage, kExitWaitMs)) << "the server list did not exit";
    }
};
} // namespace

TEST_F(ServerListE2E, ListsTheServersOfEachCategoryWithTheirNames)
{
    Da20OnlyServer second;
    ComPtr<IOPCServerList2> list;
    ASSERT_EQ(CoCreateInstance(kServerList, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServerList2,
                               reinterpret_cast<void **>(list.Out())),
              S_OK);
    std::vector<CLSID> da10 = ClassesOf(list.Get(), kDa10), da20 = ClassesOf(list.Get(), kDa20);
    EXPECT_TRUE(Holds(da10, CLSID_SkylarcOPCServerE2E));
    EXPECT_TRUE(Holds(da20, CLSID_SkylarcOPCServerE2E));
    EXPECT_FALSE(Holds(da10, kDa20Only)) << "the category filter";
    EXPECT_TRUE(Holds(da20, kDa20Only));

    // The DA 1.0 list interface: the same classes through IEnumGUID.
    ComPtr<IOPCServerList> list1;
    ASSERT_EQ(list.As(list1), S_OK);
    CATID wanted = kDa20;
    ComPtr<IEnumGUID> classes;
    ASSERT_EQ(list1->EnumClassesOfCategories(1, &wanted, 0, nullptr, classes.Out()), S_OK);
    EXPECT_EQ(Drain(classes.Get()).size(), da20.size());

    LPOLESTR progId = nullptr, userType = nullptr, independent = nullptr;
    ASSERT_EQ(list->GetClassDetails(CLSID_SkylarcOPCServerE2E, &progId, &userType, &independent), S_OK);
    TaskMem<wchar_t> p(progId), u(userType), i(independent);
    EXPECT_STREQ(progId, L"Tarnwell.SkylarcOPCServer.1");
    EXPECT_STREQ(userType, L"OPC Server Interface to Skylarc");
    EXPECT_STREQ(independent, L"Tarnwell.SkylarcOPCServer");
    // A class without a version-independent ProgID gives an empty one.
    ASSERT_EQ(list->GetClassDetails(kDa20Only, &progId, &userType, &independent), S_OK);
    TaskMem<wchar_t> p2(progId), u2(userType), i2(independent);
    EXPECT_STREQ(progId, kDa20OnlyProgId);
    EXPECT_STREQ(independent, L"");
    ASSERT_EQ(list1->GetClassDetails(CLSID_SkylarcOPCServerE2E, &progId, &userType), S_OK);
    TaskMem<wchar_t> p3(progId), u3(userType);
    EXPECT_STREQ(progId, L"Tarnwell.SkylarcOPCServer.1");

    CLSID clsid = CLSID_NULL;
    EXPECT_EQ(list->CLSIDFromProgID(L"Tarnwell.SkylarcOPCServer", &clsid), S_OK);
    EXPECT_TRUE(IsEqualCLSID(clsid, CLSID_SkylarcOPCServerE2E));
    EXPECT_EQ(list1->CLSIDFromProgID(kDa20OnlyProgId, &clsid), S_OK);
    EXPECT_TRUE(IsEqualCLSID(clsid, kDa20Only));

    // Unknown names and enumerators asked for nothing or for far too much.
    EXPECT_EQ(list->CLSIDFromProgID(L"No.Such.Server", &clsid), REGDB_E_CLASSNOTREG);
    EXPECT_TRUE(IsEqualCLSID(clsid, CLSID_NULL));
    EXPECT_EQ(list->CLSIDFromProgID(L"{5B1E7A20-4C3D-11D3-9A44-00A0C9E2B7F1}", &clsid), REGDB_E_CLASSNOTREG);
    const CLSID unknown = {0x5b1e7a2e, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
    EXPECT_EQ(list->GetClassDetails(unknown, &progId, &userType, &independent), REGDB_E_CLASSNOTREG);
    EXPECT_EQ(progId, nullptr);
    ComPtr<IOPCEnumGUID> all;
    ASSERT_EQ(list->EnumClassesOfCategories(1, &wanted, 0, nullptr, all.Out()), S_OK);
    CLSID one;
    ULONG fetched = 7;
    EXPECT_EQ(all->Next(0, &one, &fetched), S_OK);
    EXPECT_EQ(fetched, 0u);
    EXPECT_EQ(all->Skip(0x80000000u), S_FALSE);
    EXPECT_EQ(all->Next(1, &one, &fetched), S_FALSE);
    EXPECT_EQ(all->Reset(), S_OK);
    ComPtr<IOPCEnumGUID> clone;
    ASSERT_EQ(all->Clone(clone.Out()), S_OK);
    EXPECT_EQ(Drain(clone.Get()).size(), da20.size());
    HRESULT huge = all->Next(0x80000000u, &one, &fetched); // the stub cannot hold the answer
    EXPECT_NE(huge, S_OK);
    EXPECT_EQ(list->CLSIDFromProgID(L"Tarnwell.SkylarcOPCServer", &clsid), S_OK) << "the list still serves";
}

TEST_F(ServerListE2E, RegistrationKeepsAnotherServerListAndRemovesOnlyItsOwn)
{
    const std::wstring ours = ReadString(HKEY_CLASSES_ROOT, std::wstring(kListKey) + L"\\LocalServer32", nullptr);
    EXPECT_NE(ours.find(kListImage), std::wstring::npos) << ours;

    // Another installation's list: registration leaves it as it is.
    EXPECT_EQ(RunList(L"/UnregServer"), 0);
    const std::wstring theirs = L"C:\\Program Files\\Another OPC Core\\OpcEnum.exe -Service";
    WriteText(std::wstring(kListKey) + L"\\LocalServer32", nullptr, theirs);
    EXPECT_EQ(RunList(L"/RegServer"), 1);
    EXPECT_EQ(ReadString(HKEY_CLASSES_ROOT, std::wstring(kListKey) + L"\\LocalServer32", nullptr), theirs);
    EXPECT_EQ(RunList(L"/UnregServer"), 1);
    EXPECT_EQ(ReadString(HKEY_CLASSES_ROOT, std::wstring(kListKey) + L"\\LocalServer32", nullptr), theirs);
    EXPECT_FALSE(KeyExists(HKEY_CLASSES_ROOT, L"AppID\\SkylarcServerList.exe")) << "nothing of ours is written";

    // With none registered it registers, and removes what it wrote.
    RegDeleteTreeW(HKEY_CLASSES_ROOT, kListKey);
    EXPECT_EQ(RunList(L"/RegServer"), 0);
    EXPECT_EQ(ReadString(HKEY_CLASSES_ROOT, std::wstring(kListKey) + L"\\LocalServer32", nullptr), ours);
    EXPECT_EQ(ReadString(HKEY_CLASSES_ROOT, L"OPC.ServerList\\CurVer", nullptr), L"OPC.ServerList.1");
    EXPECT_EQ(RunList(L"/UnregServer"), 0);
    EXPECT_FALSE(KeyExists(HKEY_CLASSES_ROOT, kListKey));
    EXPECT_FALSE(KeyExists(HKEY_CLASSES_ROOT, L"OPC.ServerList.1"));
    EXPECT_FALSE(KeyExists(HKEY_CLASSES_ROOT, L"AppID\\SkylarcServerList.exe"));
    EXPECT_EQ(RunList(L"/UnregServer"), 1) << "nothing registered";
}

TEST_F(ServerListE2E, OpcServersGivesTheSameRowsWithAndWithoutTheList)
{
    Da20OnlyServer second;
    OpcRun asked = Opc("servers --json");
    EXPECT_EQ(asked.code, 0) << asked.output;
    EXPECT_GT(CountProcesses(kListImage), 0) << "opc servers asked the list";
    EXPECT_TRUE(Has(asked.output, R"("progId":"Tarnwell.SkylarcOPCServer","clsid")")) << asked.output;
    EXPECT_TRUE(Has(asked.output, R"("progId":"Skylarc.ListTestServer.1")")) << asked.output;
    EXPECT_TRUE(Has(asked.output, R"("vendor":"Tarnwell, Inc.")")) << asked.output;
    OpcRun local = Opc("servers --json --host localhost");
    EXPECT_EQ(local.code, 0);
    EXPECT_EQ(local.output, asked.output);

    ASSERT_TRUE(WaitForNoProcess(kListImage, kExitWaitMs));
    EXPECT_EQ(RunList(L"/UnregServer"), 0);
    OpcRun read = Opc("servers --json");
    EXPECT_EQ(read.code, 0);
    EXPECT_EQ(read.output, asked.output);
    EXPECT_EQ(CountProcesses(kListImage), 0);
    EXPECT_EQ(Opc("servers").output, Opc("servers --host 127.0.0.1").output);
}
