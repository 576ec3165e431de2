// Every method that returns strings or arrays, called with 1,000-element
// requests on a server in this process and on one in its own process: what
// arrives through the proxies must be what the objects gave.
#include "ClassFactory.h"
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "TestSink.h"
#include "opccomn.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <ocidl.h>

#include <sstream>
#include <string>
#include <vector>

namespace {
const DWORD kCount = 1000;
const OPCHANDLE kBadHandle = 0xDEADBEEF;

// Constant members only, so that both networks give the same values; no
// implicit member, whose canonical type comes from its object until the
// network's attributes arrive, at a moment of their own.
const wchar_t *const kIds[] = {
    L"\\\\.\\proc1\\Setpoints.temperature",
    L"\\\\.\\proc1\\Setpoints.enabled",
    L"\\\\.\\proc1\\Setpoints.label",
    L"\\\\.\\proc1\\Setpoints.code",
    L"\\\\.\\proc1\\Setpoints.command",
    L"\\\\.\\proc1\\Setpoints.limit",
    L"\\\\.\\proc2\\Mixer.batch",
    L"\\\\.\\proc1\\Pump.speed",
    L"\\\\.\\proc1\\Pump.status",
    L"\\\\.\\proc1\\Line\\Tank.valve",
    L"\\\\PLANT7\\control\\Boiler.mode",
    L"\\\\.\\proc1\\Setpoints.nosuch",
    L"\\\\.\\proc1\\Setpoints.temperature.past",
    L"no identifier at all",
    L"",
};
const VARTYPE kTypes[] = {VT_EMPTY, VT_BSTR, VT_I4, VT_R4, VT_BOOL, 0x7FFF};
const HRESULT kCodes[] = {S_OK,
                          E_FAIL,
                          E_INVALIDARG,
                          E_OUTOFMEMORY,
                          OPC_E_UNKNOWNITEMID,
                          OPC_E_BADTYPE,
                          OPC_E_INVALIDITEMID,
                          OPC_S_UNSUPPORTEDRATE,
                          E_ACCESSDENIED,
                          static_cast<HRESULT>(0x8FFF1234),
                          OPC_E_UNKNOWNPATH,
                          OPC_E_INVALID_PID};
const DWORD kProperties[] = {1, 2, 3, 5, 6, 7, 8, 100, 101, 102, 0, 4999, 5000, 9};

// One server's answers, line by line. Server handles are shown by the index
// of the item they were given to, as the two servers number differently.
class Transcript {
public:
    std::vector<std::wstring> lines;

    template <class... Parts> void Line(const Parts &...parts)
    {
        std::wostringstream s;
        (s << ... << parts);
        lines.push_back(s.str());
    }
    static std::wstring Hex(HRESULT hr)
    {
        std::wostringstream s;
        s << std::hex << static_cast<unsigned long>(hr);
        return s.str();
    }
    static std::wstring Text(const wchar_t *s) { return s ? L"\"" + std::wstring(s) + L"\"" : L"(null)"; }
    static std::wstring Show(const VARIANT &v)
    {
        std::wostringstream s;
        s << L"vt" << V_VT(&v);
        if (V_VT(&v) & VT_ARRAY) {
            SAFEARRAY *a = V_ARRAY(&v);
            LONG lo = 0, hi = -1;
            if (a && SUCCEEDED(SafeArrayGetLBound(a, 1, &lo)) && SUCCEEDED(SafeArrayGetUBound(a, 1, &hi)))
                s << L"[" << lo << L".." << hi << L"]";
            if (a && V_VT(&v) == (VT_ARRAY | VT_R8))
                for (LONG i = lo; i <= hi; ++i) {
                    double d = 0;
                    SafeArrayGetElement(a, &i, &d);
                    s << L" " << d;
                }
            return s.str();
        }
        VARIANT text;
        VariantInit(&text);
        if (SUCCEEDED(VariantChangeType(&text, const_cast<VARIANT *>(&v), 0, VT_BSTR)))
            s << L" " << Text(V_BSTR(&text));
        VariantClear(&text);
        return s.str();
    }
    std::wstring Handle(OPCHANDLE h) const
    {
        for (size_t i = 0; i < handles.size(); ++i)
            if (handles[i] == h && h != kBadHandle)
                return L"#" + std::to_wstring(i);
        return h == kBadHandle ? L"bad" : L"?";
    }
    std::vector<OPCHANDLE> handles; // per item definition; kBadHandle when not added
};

std::vector<std::wstring> Strings(IEnumString *e, ULONG ask)
{
    std::vector<std::wstring> out;
    for (;;) {
        std::vector<LPOLESTR> got(ask, nullptr);
        ULONG fetched = 0;
        HRESULT hr = e->Next(ask, got.data(), &fetched);
        for (ULONG i = 0; i < fetched; ++i) {
            out.push_back(Transcript::Text(got[i]));
            CoTaskMemFree(got[i]);
        }
        if (hr != S_OK || fetched == 0)
            return out;
    }
}

void Common(IOPCServer *server, Transcript &t)
{
    ComPtr<IOPCCommon> common;
    ASSERT_EQ(server->QueryInterface(IID_IOPCCommon, reinterpret_cast<void **>(common.Out())), S_OK);
    DWORD n = 0;
    LCID *locales = nullptr;
    t.Line(L"locales ", Transcript::Hex(common->QueryAvailableLocaleIDs(&n, &locales)), L" ", n);
    for (DWORD i = 0; i < n; ++i)
        t.Line(L"  ", locales[i]);
    CoTaskMemFree(locales);
    for (int round = 0; round < 20; ++round)
        for (HRESULT code : kCodes) {
            LPWSTR a = nullptr, b = nullptr;
            HRESULT ha = server->GetErrorString(code, 0x409, &a);
            HRESULT hb = common->GetErrorString(code, &b);
            t.Line(L"error ", Transcript::Hex(code), L" ", Transcript::Hex(ha), L" ", Transcript::Text(a), L" ",
                   Transcript::Hex(hb), L" ", Transcript::Text(b));
            CoTaskMemFree(a);
            CoTaskMemFree(b);
        }
    OPCSERVERSTATUS *status = nullptr;
    ASSERT_EQ(server->GetStatus(&status), S_OK);
    t.Line(L"status ", status->dwServerState, L" ", status->dwGroupCount, L" ", status->wMajorVersion, L".",
           status->wMinorVersion, L" ", Transcript::Text(status->szVendorInfo));
    CoTaskMemFree(status->szVendorInfo);
    CoTaskMemFree(status);
}

void Groups(IOPCServer *server, Transcript &t)
{
    std::vector<OPCHANDLE> groups;
    for (int i = 0; i < 150; ++i) {
        OPCHANDLE h = 0;
        DWORD rate = 0;
        ComPtr<IUnknown> unknown;
        std::wstring name = L"parity group " + std::to_wstring(i);
        ASSERT_EQ(
            server->AddGroup(name.c_str(), FALSE, 1000, i, nullptr, nullptr, 0, &h, &rate, IID_IUnknown, unknown.Out()),
            S_OK);
        groups.push_back(h);
    }
    ComPtr<IEnumString> names;
    ASSERT_EQ(server->CreateGroupEnumerator(OPC_ENUM_ALL, IID_IEnumString, reinterpret_cast<IUnknown **>(names.Out())),
              S_OK);
    for (const auto &s : Strings(names.Get(), kCount))
        t.Line(L"group ", s);
    for (OPCHANDLE h : groups)
        server->RemoveGroup(h, TRUE);
}

void Items(IOPCServer *server, Transcript &t)
{
    OPCHANDLE hGroup = 0;
    DWORD rate = 0;
    ComPtr<IOPCItemMgt> items;
    ASSERT_EQ(server->AddGroup(L"parity", FALSE, 1000, 7, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                               reinterpret_cast<IUnknown **>(items.Out())),
              S_OK);
    ComPtr<IOPCGroupStateMgt> state;
    ASSERT_EQ(items.As(state), S_OK);
    LPWSTR name = nullptr;
    DWORD r;
    BOOL active;
    LONG bias;
    FLOAT deadband;
    LCID lcid;
    OPCHANDLE client, own;
    t.Line(L"state ", Transcript::Hex(state->GetState(&r, &active, &name, &bias, &deadband, &lcid, &client, &own)),
           L" ", Transcript::Text(name));
    CoTaskMemFree(name);

    std::vector<OPCITEMDEF> defs(kCount);
    for (DWORD i = 0; i < kCount; ++i) {
        defs[i].szItemID = const_cast<wchar_t *>(kIds[i % std::size(kIds)]);
        defs[i].szAccessPath = const_cast<wchar_t *>(i % 7 == 3 ? L"path" : L"");
        defs[i].bActive = i % 2;
        defs[i].hClient = 1000 + i;
        defs[i].vtRequestedDataType = kTypes[i % std::size(kTypes)];
    }
    for (BOOL add : {FALSE, TRUE}) {
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        HRESULT hr = add ? items->AddItems(kCount, defs.data(), &results, &errors)
                         : items->ValidateItems(kCount, defs.data(), TRUE, &results, &errors);
        t.Line(add ? L"add " : L"validate ", Transcript::Hex(hr));
        ASSERT_TRUE(results && errors);
        for (DWORD i = 0; i < kCount; ++i) {
            t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]), L" vt", results[i].vtCanonicalDataType, L" rights ",
                   results[i].dwAccessRights, L" blob ", results[i].dwBlobSize);
            if (add)
                t.handles.push_back(SUCCEEDED(errors[i]) ? results[i].hServer : kBadHandle);
            CoTaskMemFree(results[i].pBlob);
        }
        CoTaskMemFree(results);
        CoTaskMemFree(errors);
    }
    std::vector<OPCHANDLE> handles = t.handles;

    ComPtr<IOPCSyncIO> sync;
    ASSERT_EQ(items.As(sync), S_OK);
    for (int round = 0; round < 5; ++round)
        for (OPCDATASOURCE source : {OPC_DS_CACHE, OPC_DS_DEVICE}) {
            OPCITEMSTATE *states = nullptr;
            HRESULT *errors = nullptr;
            t.Line(L"read ", source, L" ",
                   Transcript::Hex(sync->Read(source, kCount, handles.data(), &states, &errors)));
            ASSERT_TRUE(states && errors);
            for (DWORD i = 0; i < kCount; ++i) {
                t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]), L" ", states[i].hClient, L" q", states[i].wQuality,
                       L" ", Transcript::Show(states[i].vDataValue));
                VariantClear(&states[i].vDataValue);
            }
            CoTaskMemFree(states);
            CoTaskMemFree(errors);
        }

    // Writes of each constant's own value, as text, leave both networks equal.
    std::vector<VARIANT> values(kCount);
    const wchar_t *const texts[] = {L"21.5",  L"True", L"Line 1",  L"A-17",  L"0",   L"100",
                                    L"B-001", L"1450", L"running", L"False", L"auto"};
    for (DWORD i = 0; i < kCount; ++i) {
        V_VT(&values[i]) = VT_BSTR;
        V_BSTR(&values[i]) = SysAllocString(texts[i % std::size(kIds) % std::size(texts)]);
    }
    HRESULT *errors = nullptr;
    t.Line(L"write ", Transcript::Hex(sync->Write(kCount, handles.data(), values.data(), &errors)));
    ASSERT_TRUE(errors);
    for (DWORD i = 0; i < kCount; ++i)
        t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
    CoTaskMemFree(errors);

    // Asynchronous requests: their error arrays, then their completions.
    TestSink sink;
    {
        ComPtr<IConnectionPointContainer> container;
        ComPtr<IConnectionPoint> point;
        ASSERT_EQ(items.As(container), S_OK);
        ASSERT_EQ(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out()), S_OK);
        DWORD cookie = 0;
        ASSERT_EQ(point->Advise(&sink, &cookie), S_OK);
        ComPtr<IOPCAsyncIO2> async;
        ASSERT_EQ(items.As(async), S_OK);
        DWORD cancel = 0;
        t.Line(L"async read ", Transcript::Hex(async->Read(kCount, handles.data(), 1, &cancel, &errors)));
        for (DWORD i = 0; errors && i < kCount; ++i)
            t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
        CoTaskMemFree(errors);
        errors = nullptr;
        t.Line(L"async write ",
               Transcript::Hex(async->Write(kCount, handles.data(), values.data(), 2, &cancel, &errors)));
        for (DWORD i = 0; errors && i < kCount; ++i)
            t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
        CoTaskMemFree(errors);
        errors = nullptr;
        EXPECT_TRUE(sink.WaitFor([](const std::vector<Callback> &calls) { return calls.size() >= 2; }, 30000));
        for (const Callback &c : sink.Snapshot())
            t.Line(L"completion ", c.kind, L" ", c.transid, L" ", c.clients.size(), L" ",
                   Transcript::Hex(c.masterError));
        EXPECT_EQ(point->Unadvise(cookie), S_OK);
    }
    for (VARIANT &v : values)
        VariantClear(&v);

    std::vector<VARTYPE> types(kCount);
    std::vector<OPCHANDLE> clients(kCount);
    for (DWORD i = 0; i < kCount; ++i) {
        types[i] = kTypes[(i + 1) % std::size(kTypes)];
        clients[i] = 5000 + i;
    }
    t.Line(L"active ", Transcript::Hex(items->SetActiveState(kCount, handles.data(), TRUE, &errors)));
    for (DWORD i = 0; errors && i < kCount; ++i)
        t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
    CoTaskMemFree(errors);
    t.Line(L"clients ", Transcript::Hex(items->SetClientHandles(kCount, handles.data(), clients.data(), &errors)));
    for (DWORD i = 0; errors && i < kCount; ++i)
        t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
    CoTaskMemFree(errors);
    t.Line(L"types ", Transcript::Hex(items->SetDatatypes(kCount, handles.data(), types.data(), &errors)));
    for (DWORD i = 0; errors && i < kCount; ++i)
        t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
    CoTaskMemFree(errors);

    ComPtr<IEnumOPCItemAttributes> attributes;
    ASSERT_EQ(items->CreateEnumerator(IID_IEnumOPCItemAttributes, reinterpret_cast<IUnknown **>(attributes.Out())),
              S_OK);
    for (;;) {
        OPCITEMATTRIBUTES *a = nullptr;
        ULONG fetched = 0;
        HRESULT hr = attributes->Next(kCount / 3, &a, &fetched);
        t.Line(L"attributes ", Transcript::Hex(hr), L" ", fetched);
        for (ULONG i = 0; i < fetched; ++i) {
            t.Line(L"  ", t.Handle(a[i].hServer), L" ", a[i].bActive, L" ", a[i].hClient, L" ", a[i].dwAccessRights,
                   L" ", a[i].vtRequestedDataType, L" ", a[i].vtCanonicalDataType, L" ", a[i].dwEUType, L" ",
                   Transcript::Show(a[i].vEUInfo), L" ", Transcript::Text(a[i].szAccessPath), L" ",
                   Transcript::Text(a[i].szItemID), L" ", a[i].dwBlobSize);
            CoTaskMemFree(a[i].szAccessPath);
            CoTaskMemFree(a[i].szItemID);
            CoTaskMemFree(a[i].pBlob);
            VariantClear(&a[i].vEUInfo);
        }
        CoTaskMemFree(a);
        if (hr != S_OK)
            break;
    }

    // The first half again, so that every handle of it goes twice.
    handles.insert(handles.end(), t.handles.begin(), t.handles.begin() + kCount / 2);
    t.Line(L"remove ", Transcript::Hex(items->RemoveItems(kCount, handles.data() + kCount / 2, &errors)));
    for (DWORD i = 0; errors && i < kCount; ++i)
        t.Line(L"  ", i, L" ", Transcript::Hex(errors[i]));
    CoTaskMemFree(errors);
    EXPECT_EQ(server->RemoveGroup(hGroup, FALSE), OPC_S_INUSE) << "the test still holds the group";
}

void Properties(IOPCServer *server, Transcript &t)
{
    ComPtr<IOPCItemProperties> props;
    ASSERT_EQ(server->QueryInterface(IID_IOPCItemProperties, reinterpret_cast<void **>(props.Out())), S_OK);
    std::vector<DWORD> ids(kCount);
    for (DWORD i = 0; i < kCount; ++i)
        ids[i] = kProperties[i % std::size(kProperties)];
    for (const wchar_t *item : kIds) {
        DWORD n = 0;
        DWORD *pids = nullptr;
        LPWSTR *descriptions = nullptr;
        VARTYPE *vts = nullptr;
        t.Line(L"available ", Transcript::Text(item), L" ",
               Transcript::Hex(
                   props->QueryAvailableProperties(const_cast<wchar_t *>(item), &n, &pids, &descriptions, &vts)),
               L" ", n);
        for (DWORD i = 0; i < n; ++i) {
            t.Line(L"  ", pids[i], L" ", Transcript::Text(descriptions[i]), L" ", vts[i]);
            CoTaskMemFree(descriptions[i]);
        }
        CoTaskMemFree(pids);
        CoTaskMemFree(descriptions);
        CoTaskMemFree(vts);
    }
    for (int round = 0; round < 10; ++round)
        for (const wchar_t *item : {kIds[0], kIds[6], kIds[10], kIds[11]}) {
            VARIANT *data = nullptr;
            HRESULT *errors = nullptr;
            t.Line(L"properties ", Transcript::Text(item), L" ",
                   Transcript::Hex(
                       props->GetItemProperties(const_cast<wchar_t *>(item), kCount, ids.data(), &data, &errors)));
            for (DWORD i = 0; data && errors && i < kCount; ++i) {
                t.Line(L"  ", ids[i], L" ", Transcript::Hex(errors[i]), L" ", Transcript::Show(data[i]));
                VariantClear(&data[i]);
            }
            CoTaskMemFree(data);
            CoTaskMemFree(errors);
            LPWSTR *newIds = nullptr;
            t.Line(L"lookup ", Transcript::Text(item), L" ",
                   Transcript::Hex(
                       props->LookupItemIDs(const_cast<wchar_t *>(item), kCount, ids.data(), &newIds, &errors)));
            for (DWORD i = 0; newIds && errors && i < kCount; ++i) {
                t.Line(L"  ", ids[i], L" ", Transcript::Hex(errors[i]), L" ", Transcript::Text(newIds[i]));
                CoTaskMemFree(newIds[i]);
            }
            CoTaskMemFree(newIds);
            CoTaskMemFree(errors);
        }
}

void Browse(IOPCServer *server, Transcript &t)
{
    ComPtr<IOPCBrowseServerAddressSpace> browse;
    ASSERT_EQ(server->QueryInterface(IID_IOPCBrowseServerAddressSpace, reinterpret_cast<void **>(browse.Out())), S_OK);
    OPCNAMESPACETYPE organization;
    t.Line(L"organization ", Transcript::Hex(browse->QueryOrganization(&organization)), L" ", organization);
    for (OPCBROWSETYPE type : {OPC_FLAT, OPC_BRANCH, OPC_LEAF}) {
        ComPtr<IEnumString> e;
        HRESULT hr = browse->BrowseOPCItemIDs(type, const_cast<wchar_t *>(L""), VT_EMPTY, 0, e.Out());
        t.Line(L"browse ", type, L" ", Transcript::Hex(hr));
        if (e)
            for (const auto &s : Strings(e.Get(), type == OPC_FLAT ? kCount : 3))
                t.Line(L"  ", s);
    }
    t.Line(L"down ", Transcript::Hex(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc1\\Setpoints")));
    for (const wchar_t *leaf : {L"temperature", L"label", L"nosuch", L""}) {
        LPWSTR id = nullptr;
        t.Line(L"id ", Transcript::Text(leaf), L" ",
               Transcript::Hex(browse->GetItemID(const_cast<wchar_t *>(leaf), &id)), L" ", Transcript::Text(id));
        CoTaskMemFree(id);
        ComPtr<IEnumString> paths;
        t.Line(L"paths ", Transcript::Hex(browse->BrowseAccessPaths(leaf, paths.Out())));
        if (paths)
            for (const auto &s : Strings(paths.Get(), 10))
                t.Line(L"  ", s);
    }
}

std::vector<std::wstring> TranscriptOf(IOPCServer *server)
{
    Transcript t;
    Common(server, t);
    Groups(server, t);
    Items(server, t);
    Properties(server, t);
    Browse(server, t);
    return t.lines;
}
} // namespace

TEST(WireParityE2E, StringAndArrayResultsCrossTheProcessBoundaryUnchanged)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    std::vector<std::wstring> local, inProcess;
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        local = TranscriptOf(server.Get());
    }
    {
        static CServerClassFactory factory;
        ComPtr<IOPCServer> server;
        ASSERT_EQ(factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out())), S_OK);
        inProcess = TranscriptOf(server.Get());
    }
    EXPECT_GT(local.size(), 20000u);
    ASSERT_EQ(local.size(), inProcess.size());
    size_t differences = 0;
    for (size_t i = 0; i < local.size() && differences < 20; ++i)
        if (local[i] != inProcess[i]) {
            ++differences;
            ADD_FAILURE() << "line " << i << "\n  through COM: " << testing::PrintToString(local[i])
                          << "\n  in process:  " << testing::PrintToString(inProcess[i]);
        }
    EXPECT_TRUE(WaitForNoServerProcess(20000));
}
