// Item management and synchronous I/O of a group in this process, against
// the simulated default network.
#include "CadroSim.h"
#include "FailingAllocations.h"
#include "InProcServer.h"
#include "OpcErrors.h"
#include "ValueConversion.h"

#include <atomic>
#include <thread>

namespace {
const wchar_t kTemperature[] = L"\\\\.\\proc1\\Setpoints.temperature"; // number, rw, 21.5
const wchar_t kLimit[] = L"\\\\.\\proc1\\Setpoints.limit";             // number, r, 100
const wchar_t kLabel[] = L"\\\\.\\proc1\\Setpoints.label";             // wide text, rw

OPCITEMDEF Def(const wchar_t *id, OPCHANDLE client = 1, VARTYPE requested = VT_EMPTY, BOOL active = TRUE)
{
    OPCITEMDEF d = {};
    d.szItemID = const_cast<wchar_t *>(id);
    d.bActive = active;
    d.hClient = client;
    d.vtRequestedDataType = requested;
    return d;
}

class ItemMgtTest : public testing::Test {
protected:
    void SetUp() override
    {
        ResetNetwork(); // the described values, whatever ran before
        server = CreateInProcServer();
        auto g = AddGroup(server.Get(), L"items", 100, TRUE);
        ASSERT_EQ(g.hr, S_OK);
        ASSERT_EQ(g.group.As(items), S_OK);
        ASSERT_EQ(g.group.As(io), S_OK);
        state = g.group;
    }

    // Adds definitions; returns the per-item results and errors.
    HRESULT Add(std::vector<OPCITEMDEF> defs, std::vector<OPCITEMRESULT> &results, std::vector<HRESULT> &errors)
    {
        OPCITEMRESULT *r = nullptr;
        HRESULT *e = nullptr;
        HRESULT hr = items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &r, &e);
        results.assign(r, r ? r + defs.size() : r);
        errors.assign(e, e ? e + defs.size() : e);
        CoTaskMemFree(r);
        CoTaskMemFree(e);
        return hr;
    }
    OPCHANDLE AddOne(const wchar_t *id, VARTYPE requested = VT_EMPTY, BOOL active = TRUE, OPCHANDLE client = 1)
    {
        std::vector<OPCITEMRESULT> r;
        std::vector<HRESULT> e;
        EXPECT_EQ(Add({Def(id, client, requested, active)}, r, e), S_OK) << id;
        return r.empty() ? 0 : r[0].hServer;
    }
    struct ReadOne {
        HRESULT hr;
        CVariant value;
        WORD quality = 0;
        OPCHANDLE client = 0;
    };
    void Read(OPCHANDLE handle, OPCDATASOURCE source, ReadOne &out)
    {
        OPCITEMSTATE *states = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_TRUE(SUCCEEDED(io->Read(source, 1, &handle, &states, &errors)));
        out.hr = errors[0];
        out.quality = states[0].wQuality;
        out.client = states[0].hClient;
        MoveVariant(out.value.Get(), &states[0].vDataValue);
        CoTaskMemFree(states);
        CoTaskMemFree(errors);
    }
    std::vector<OPCITEMATTRIBUTES> Enumerate(IEnumOPCItemAttributes *e)
    {
        std::vector<OPCITEMATTRIBUTES> out;
        OPCITEMATTRIBUTES *batch = nullptr;
        ULONG fetched = 0;
        while (SUCCEEDED(e->Next(2, &batch, &fetched)) && fetched > 0) {
            for (ULONG i = 0; i < fetched; ++i) {
                out.push_back(batch[i]);
                CoTaskMemFree(batch[i].szAccessPath);
                CoTaskMemFree(batch[i].szItemID);
                out.back().szAccessPath = out.back().szItemID = nullptr;
            }
            CoTaskMemFree(batch);
        }
        return out;
    }

    ComPtr<IOPCServer> server;
    ComPtr<IOPCGroupStateMgt> state;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IOPCSyncIO> io;
};
} // namespace

TEST_F(ItemMgtTest, AddItemsReportsEachItemAndKeepsTheOthers)
{
    std::vector<OPCITEMRESULT> r;
    std::vector<HRESULT> e;
    EXPECT_EQ(Add({Def(kTemperature, 1), Def(L"", 2), Def(kTemperature, 3), Def(L"\\\\.\\proc1\\Nope.x", 4),
                   Def(kLabel, 5, VT_R8)},
                  r, e),
              S_FALSE);
    // The label is a text member in the address space: no number from "".
    EXPECT_EQ(e, (std::vector<HRESULT>{S_OK, OPC_E_INVALIDITEMID, S_OK, OPC_E_UNKNOWNITEMID, OPC_E_BADTYPE}));
    EXPECT_EQ(r[1].hServer, 0u);
    EXPECT_EQ(r[1].vtCanonicalDataType, 0);
    EXPECT_NE(r[0].hServer, r[2].hServer) << "the same identifier twice gives two items";
    EXPECT_EQ(r[0].vtCanonicalDataType, VT_R8);

    OPCITEMRESULT *results = reinterpret_cast<OPCITEMRESULT *>(1);
    HRESULT *errors = reinterpret_cast<HRESULT *>(1);
    EXPECT_EQ(items->AddItems(0, nullptr, &results, &errors), E_INVALIDARG);
    EXPECT_EQ(results, nullptr);
    EXPECT_EQ(errors, nullptr);
    OPCITEMDEF def = Def(kTemperature);
    EXPECT_EQ(items->AddItems(1, nullptr, &results, &errors), E_INVALIDARG);
    EXPECT_EQ(items->AddItems(1, &def, nullptr, &errors), E_INVALIDARG);
    EXPECT_EQ(items->AddItems(100000000, &def, &results, &errors), E_INVALIDARG) << "a count the array lacks";
    EXPECT_EQ(results, nullptr);

    // Removing: one known, one unknown, then the known one again.
    OPCHANDLE handles[] = {r[0].hServer, 0xDEAD};
    EXPECT_EQ(items->RemoveItems(2, handles, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], OPC_E_INVALIDHANDLE);
    CoTaskMemFree(errors);
    EXPECT_EQ(items->RemoveItems(1, handles, &errors), S_FALSE);
    EXPECT_EQ(errors[0], OPC_E_INVALIDHANDLE);
    CoTaskMemFree(errors);
    EXPECT_EQ(items->RemoveItems(0, handles, &errors), E_INVALIDARG);
}

TEST_F(ItemMgtTest, ValidateItemsCreatesNothing)
{
    OPCITEMDEF defs[] = {Def(kTemperature), Def(L"\\\\.\\proc1"), Def(L""), Def(kTemperature, 1, VT_DISPATCH),
                         Def(L"\\\\.\\p\\'open")};
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    EXPECT_EQ(items->ValidateItems(5, defs, TRUE, &results, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(results[0].vtCanonicalDataType, VT_R8);
    EXPECT_EQ(results[0].dwAccessRights, 3u);
    EXPECT_EQ(results[0].hServer, 0u);
    EXPECT_EQ(errors[1], OPC_E_UNKNOWNITEMID);
    EXPECT_EQ(errors[2], OPC_E_INVALIDITEMID);
    EXPECT_EQ(errors[3], OPC_E_BADTYPE);
    EXPECT_EQ(results[3].vtCanonicalDataType, 0);
    EXPECT_EQ(errors[4], OPC_E_UNKNOWNITEMID);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    ComPtr<IEnumOPCItemAttributes> e;
    EXPECT_EQ(items->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(e.Out())), S_FALSE);

    // Every VARTYPE as a requested type: a per-item answer, never a crash.
    std::vector<OPCITEMDEF> all;
    for (unsigned vt = 0; vt <= 0xFFFF; ++vt)
        all.push_back(Def(kTemperature, vt, static_cast<VARTYPE>(vt)));
    EXPECT_EQ(items->ValidateItems(static_cast<DWORD>(all.size()), all.data(), FALSE, &results, &errors), S_FALSE);
    EXPECT_EQ(errors[VT_I4], S_OK);
    EXPECT_EQ(errors[VT_DISPATCH], OPC_E_BADTYPE);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
}

TEST_F(ItemMgtTest, ActivityHandlesAndTypesChangeThroughTheGroup)
{
    OPCHANDLE h = AddOne(kTemperature, VT_EMPTY, FALSE, 10);
    ReadOne r;
    Read(h, OPC_DS_CACHE, r);
    EXPECT_EQ(r.hr, S_OK);
    EXPECT_EQ(r.quality, OPC_QUALITY_OUT_OF_SERVICE) << "an inactive item, read from the cache";
    EXPECT_EQ(V_R8(r.value.Get()), 21.5);
    Read(h, OPC_DS_DEVICE, r);
    EXPECT_EQ(r.quality, OPC_QUALITY_GOOD);

    HRESULT *errors = nullptr;
    OPCHANDLE handles[] = {h, 0xBAD};
    EXPECT_EQ(items->SetActiveState(2, handles, 2, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], OPC_E_INVALIDHANDLE);
    CoTaskMemFree(errors);
    Read(h, OPC_DS_CACHE, r);
    EXPECT_EQ(r.quality, OPC_QUALITY_GOOD);

    OPCHANDLE clients[] = {99, 98};
    EXPECT_EQ(items->SetClientHandles(1, handles, clients, &errors), S_OK);
    CoTaskMemFree(errors);
    Read(h, OPC_DS_CACHE, r);
    EXPECT_EQ(r.client, 99u);

    VARTYPE types[] = {VT_BSTR};
    EXPECT_EQ(items->SetDatatypes(1, handles, types, &errors), S_OK);
    CoTaskMemFree(errors);
    Read(h, OPC_DS_CACHE, r);
    EXPECT_EQ(V_VT(r.value.Get()), VT_BSTR);
    EXPECT_STREQ(V_BSTR(r.value.Get()), L"21.5");
    types[0] = VT_DISPATCH; // accepted without a check; the read then fails
    EXPECT_EQ(items->SetDatatypes(1, handles, types, &errors), S_OK);
    CoTaskMemFree(errors);
    Read(h, OPC_DS_CACHE, r);
    EXPECT_TRUE(FAILED(r.hr));
    EXPECT_EQ(V_VT(r.value.Get()), VT_EMPTY);
    EXPECT_EQ(items->SetDatatypes(1, handles, nullptr, &errors), E_INVALIDARG);
    EXPECT_EQ(items->SetClientHandles(1, handles, clients, nullptr), E_INVALIDARG);
}

TEST_F(ItemMgtTest, EnumeratorsAreSnapshotsThatOutliveEachOther)
{
    OPCHANDLE a = AddOne(kTemperature, VT_I4, TRUE, 1);
    OPCHANDLE b = AddOne(kLimit, VT_EMPTY, FALSE, 2);
    AddOne(kLabel, VT_EMPTY, TRUE, 3);
    ComPtr<IEnumOPCItemAttributes> e;
    IUnknown *wrong = nullptr;
    EXPECT_EQ(items->CreateEnumerator(IID_IEnumString, &wrong), E_INVALIDARG);
    ASSERT_EQ(items->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(e.Out())), S_OK);
    HRESULT *errors;
    EXPECT_EQ(items->RemoveItems(1, &b, &errors), S_OK);
    CoTaskMemFree(errors);

    OPCITEMATTRIBUTES *one = nullptr;
    EXPECT_EQ(e->Next(2, &one, nullptr), E_POINTER);
    ASSERT_EQ(e->Next(1, &one, nullptr), S_OK);
    EXPECT_EQ(one->hServer, a);
    EXPECT_STREQ(one->szItemID, kTemperature);
    EXPECT_EQ(one->vtRequestedDataType, VT_I4);
    EXPECT_EQ(one->vtCanonicalDataType, VT_R8);
    EXPECT_EQ(one->dwEUType, OPC_NOENUM);
    CoTaskMemFree(one->szItemID);
    CoTaskMemFree(one->szAccessPath);
    CoTaskMemFree(one);

    ComPtr<IEnumOPCItemAttributes> clone;
    ASSERT_EQ(e->Clone(clone.Out()), S_OK);
    e.Reset(); // the clone keeps the snapshot
    auto rest = Enumerate(clone.Get());
    ASSERT_EQ(rest.size(), 2u);
    EXPECT_EQ(rest[0].hServer, b) << "the removed item is still in the snapshot";
    EXPECT_EQ(clone->Skip(5), S_FALSE);
    EXPECT_EQ(clone->Reset(), S_OK);
    EXPECT_EQ(clone->Skip(3), S_FALSE) << "skipping exactly the rest reaches the end";

    // Concurrent Next, Skip and Reset on one enumerator never pass the end.
    std::vector<std::thread> threads;
    std::atomic<bool> bad{false};
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < 300; ++i) {
                OPCITEMATTRIBUTES *p = nullptr;
                ULONG n = 0;
                clone->Next(2, &p, &n);
                if (n > 2)
                    bad = true;
                for (ULONG k = 0; k < n; ++k) {
                    CoTaskMemFree(p[k].szItemID);
                    CoTaskMemFree(p[k].szAccessPath);
                }
                CoTaskMemFree(p);
                clone->Skip(1);
                if (i % 5 == 0)
                    clone->Reset();
            }
        });
    }
    for (auto &t : threads)
        t.join();
    EXPECT_FALSE(bad);
}

TEST_F(ItemMgtTest, CloneGroupCopiesTheItems)
{
    AddOne(kTemperature, VT_I4, TRUE, 11);
    AddOne(kLimit, VT_BSTR, FALSE, 12);
    ComPtr<IOPCItemMgt> cloneItems;
    ASSERT_EQ(state->CloneGroup(L"copy", IID_IOPCItemMgt, reinterpret_cast<IUnknown **>(cloneItems.Out())), S_OK);
    ComPtr<IEnumOPCItemAttributes> source, copy;
    items->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(source.Out()));
    cloneItems->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(copy.Out()));
    auto a = Enumerate(source.Get()), b = Enumerate(copy.Get());
    ASSERT_EQ(a.size(), 2u);
    ASSERT_EQ(b.size(), 2u);
    for (size_t i = 0; i < 2; ++i) {
        EXPECT_EQ(a[i].hClient, b[i].hClient);
        EXPECT_EQ(a[i].vtRequestedDataType, b[i].vtRequestedDataType);
        EXPECT_EQ(a[i].bActive, b[i].bActive);
        EXPECT_NE(a[i].hServer, b[i].hServer);
    }
}

TEST_F(ItemMgtTest, SyncReadAndWriteTalkToTheNetwork)
{
    OPCHANDLE t = AddOne(kTemperature);
    OPCHANDLE limit = AddOne(kLimit);
    ReadOne r;
    Read(limit, OPC_DS_DEVICE, r); // the attributes have arrived by now
    EXPECT_EQ(r.hr, S_OK);
    EXPECT_EQ(V_R8(r.value.Get()), 100.0);

    // The member's read-only rights come with the network's attributes.
    OPCHANDLE handles[] = {t, limit, 0xBAD};
    for (int i = 0; i < 100; ++i) {
        CVariant probe;
        V_VT(probe.Get()) = VT_R8;
        HRESULT *e = nullptr;
        VARIANT p = probe.Value();
        io->Write(1, &limit, &p, &e);
        HRESULT rights = e[0];
        CoTaskMemFree(e);
        if (rights == OPC_E_BADRIGHTS)
            break;
        Sleep(20);
    }
    CVariant values[3];
    V_VT(values[0].Get()) = VT_I4;
    V_I4(values[0].Get()) = 7;
    V_VT(values[1].Get()) = VT_R8;
    V_R8(values[1].Get()) = 1;
    VARIANT raw[3] = {values[0].Value(), values[1].Value(), values[2].Value()};
    HRESULT *errors = nullptr;
    EXPECT_EQ(io->Write(3, handles, raw, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], OPC_E_BADRIGHTS);
    EXPECT_EQ(errors[2], OPC_E_INVALIDHANDLE);
    CoTaskMemFree(errors);

    // The network echoes the written value; a read then returns it.
    for (int i = 0; i < 100; ++i) {
        Read(t, OPC_DS_DEVICE, r);
        if (V_R8(r.value.Get()) == 7.0)
            break;
        Sleep(20);
    }
    EXPECT_EQ(V_R8(r.value.Get()), 7.0);
    Read(limit, OPC_DS_DEVICE, r);
    EXPECT_EQ(V_R8(r.value.Get()), 100.0) << "the read-only member is unchanged";

    OPCITEMSTATE *states = nullptr;
    EXPECT_EQ(io->Read(static_cast<OPCDATASOURCE>(3), 1, handles, &states, &errors), E_INVALIDARG);
    EXPECT_EQ(io->Read(OPC_DS_CACHE, 0, handles, &states, &errors), E_INVALIDARG);
    EXPECT_EQ(states, nullptr);
    EXPECT_EQ(io->Read(OPC_DS_CACHE, 3, handles, &states, &errors), S_FALSE);
    EXPECT_EQ(errors[2], OPC_E_INVALIDHANDLE);
    EXPECT_EQ(V_VT(&states[2].vDataValue), VT_EMPTY);
    for (int i = 0; i < 3; ++i)
        VariantClear(&states[i].vDataValue);
    CoTaskMemFree(states);
    CoTaskMemFree(errors);
    EXPECT_EQ(io->Write(1, handles, nullptr, &errors), E_INVALIDARG);
}

TEST_F(ItemMgtTest, HugeIdentifiersAndDuplicateHandlesGetPerItemAnswers)
{
    std::wstring huge = L"\\\\.\\proc1\\" + std::wstring(100000, L'x');
    std::wstring quote = L"\\\\.\\proc1\\'" + std::wstring(1000, L'q');
    std::vector<OPCITEMRESULT> r;
    std::vector<HRESULT> e;
    EXPECT_EQ(Add({Def(huge.c_str()), Def(quote.c_str()), Def(kTemperature)}, r, e), S_FALSE);
    EXPECT_EQ(e, (std::vector<HRESULT>{OPC_E_UNKNOWNITEMID, OPC_E_UNKNOWNITEMID, S_OK}));

    OPCITEMDEF defs[] = {Def(huge.c_str()), Def(quote.c_str())};
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    EXPECT_EQ(items->ValidateItems(2, defs, FALSE, &results, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK) << "well formed, unknown to the address space";
    EXPECT_EQ(errors[1], OPC_E_UNKNOWNITEMID) << "an unterminated quote";
    CoTaskMemFree(results);
    CoTaskMemFree(errors);

    OPCHANDLE twice[] = {r[2].hServer, r[2].hServer};
    EXPECT_EQ(items->RemoveItems(2, twice, &errors), S_FALSE);
    EXPECT_EQ(errors[0], S_OK);
    EXPECT_EQ(errors[1], OPC_E_INVALIDHANDLE);
    CoTaskMemFree(errors);
}

namespace {
std::wstring Sim(const std::wstring &command)
{
    BSTR answer = nullptr;
    CadroSim_Execute(command.c_str(), &answer);
    std::wstring text = answer ? answer : L"";
    SysFreeString(answer);
    return text;
}

unsigned long BrowsesSoFar()
{
    std::wstring status = Sim(L"status");
    size_t at = status.find(L"\nbrowses ");
    return at == std::wstring::npos ? 0 : wcstoul(status.c_str() + at + 9, nullptr, 10);
}
} // namespace

TEST_F(ItemMgtTest, OneAddItemsBrowsesEachLevelOnceAndTheNextSeesTheNetworkAgain)
{
    const int count = 400;
    for (int i = 0; i < count; ++i)
        ASSERT_EQ(Sim(L"add-member \\\\.\\proc2\\Many m" + std::to_wstring(i) + L" type=bool"), L"ok\n");
    std::vector<std::wstring> ids;
    std::vector<OPCITEMDEF> defs;
    for (int i = 0; i < count; ++i)
        ids.push_back(L"\\\\.\\proc2\\Many.m" + std::to_wstring(i));
    for (const auto &id : ids)
        defs.push_back(Def(id.c_str()));
    std::vector<OPCITEMRESULT> results;
    std::vector<HRESULT> errors;
    unsigned long before = BrowsesSoFar();
    ASSERT_EQ(Add(defs, results, errors), S_OK);
    EXPECT_EQ(BrowsesSoFar() - before, 3u) << "this machine, the process and the object, once each";
    for (const OPCITEMRESULT &r : results)
        EXPECT_EQ(r.vtCanonicalDataType, VT_BOOL);

    // Between calls one member goes, one comes back read-only, one is new.
    ASSERT_EQ(Sim(L"remove-member \\\\.\\proc2\\Many.m0"), L"ok\n");
    ASSERT_EQ(Sim(L"remove-member \\\\.\\proc2\\Many.m1"), L"ok\n");
    ASSERT_EQ(Sim(L"add-member \\\\.\\proc2\\Many m1 type=text access=r"), L"ok\n");
    ASSERT_EQ(Sim(L"add-member \\\\.\\proc2\\Many fresh type=number"), L"ok\n");
    before = BrowsesSoFar();
    ASSERT_EQ(Add({Def(ids[0].c_str()), Def(ids[1].c_str()), Def(L"\\\\.\\proc2\\Many.fresh")}, results, errors),
              S_FALSE);
    EXPECT_EQ(BrowsesSoFar() - before, 4u) << "the vanished member is looked for below \"Network\" too, once";
    EXPECT_EQ(errors[0], OPC_E_UNKNOWNITEMID) << "the network no longer has it";
    EXPECT_EQ(errors[1], S_OK);
    EXPECT_EQ(results[1].dwAccessRights, static_cast<DWORD>(OPC_READABLE));
    EXPECT_EQ(results[1].vtCanonicalDataType, VT_BSTR);
    EXPECT_EQ(errors[2], S_OK);
    EXPECT_EQ(results[2].vtCanonicalDataType, VT_R8);
    Sim(L"reset");
}

TEST_F(ItemMgtTest, MemoryRunningOutPartWayThroughAddItemsLeavesOnlyWhatItReported)
{
    // Each allocation of the call fails in turn: a failed call leaves no item
    // behind, a successful one exactly the items it reported.
    std::vector<OPCITEMDEF> defs = {Def(kTemperature, 1), Def(kLimit, 2), Def(kLabel, 3), Def(kTemperature, 4)};
    int failedCalls = 0;
    for (long k = 0; k < 5000; ++k) {
        OPCITEMRESULT *r = nullptr;
        HRESULT *e = nullptr;
        FailingAllocations::Arm(k);
        HRESULT hr = items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &r, &e);
        FailingAllocations::Disarm();
        const bool fired = FailingAllocations::Fired();
        ComPtr<IEnumOPCItemAttributes> en;
        items->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(en.Out()));
        size_t present = en ? Enumerate(en.Get()).size() : 0;
        if (FAILED(hr)) {
            ++failedCalls;
            EXPECT_EQ(hr, E_OUTOFMEMORY);
            EXPECT_EQ(present, 0u) << "allocation " << k;
            continue;
        }
        std::vector<OPCHANDLE> added;
        for (size_t i = 0; i < defs.size(); ++i)
            if (SUCCEEDED(e[i]))
                added.push_back(r[i].hServer);
        CoTaskMemFree(r);
        CoTaskMemFree(e);
        EXPECT_EQ(present, added.size()) << "allocation " << k;
        if (!added.empty()) {
            HRESULT *removed = nullptr;
            items->RemoveItems(static_cast<DWORD>(added.size()), added.data(), &removed);
            CoTaskMemFree(removed);
        }
        if (!fired)
            break; // every allocation of the call has failed once
    }
    EXPECT_GT(failedCalls, 3);
}
