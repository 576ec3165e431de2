// The DA 1.0 streams byte for byte, and IOPCAsyncIO with IDataObject in this
// process against the simulated network.
#include "InProcServer.h"
#include "OpcErrors.h"
#include "StreamBuilder.h"
#include "TestAdviseSink.h"

#include <olectl.h>

namespace {
std::vector<BYTE> Bytes(HGLOBAL memory)
{
    SIZE_T size = GlobalSize(memory);
    const BYTE *p = static_cast<const BYTE *>(GlobalLock(memory));
    std::vector<BYTE> out(p, p + size);
    GlobalUnlock(memory);
    GlobalFree(memory);
    return out;
}

DWORD At(const std::vector<BYTE> &b, size_t offset)
{
    DWORD v = 0;
    memcpy(&v, &b[offset], 4);
    return v;
}

struct TwoItems {
    OPCHANDLE clients[2] = {11, 22};
    VARIANT values[2];
    WORD qualities[2] = {0xC0, 0x00};
    FILETIME times[2] = {{1, 2}, {3, 4}};
    TwoItems()
    {
        V_VT(&values[0]) = VT_I4;
        V_I4(&values[0]) = 7;
        V_VT(&values[1]) = VT_BSTR;
        V_BSTR(&values[1]) = SysAllocString(L"abc");
    }
    ~TwoItems() { VariantClear(&values[1]); }
};
// An active group of 50 ms in a server of this process, with the given
// items (active, client handles 1, 2, ...) and its IDataObject.
struct V1Group {
    ComPtr<IOPCServer> server;
    OPCHANDLE handle = 0;
    ComPtr<IOPCItemMgt> items;
    ComPtr<IDataObject> data;
    std::vector<OPCHANDLE> handles;
};

void MakeV1Group(const wchar_t *name, OPCHANDLE clientGroup, const std::vector<const wchar_t *> &ids, V1Group &g)
{
    g.server = CreateInProcServer();
    DWORD rate;
    ASSERT_EQ(g.server->AddGroup(name, TRUE, 50, clientGroup, nullptr, nullptr, 0, &g.handle, &rate, IID_IOPCItemMgt,
                                 reinterpret_cast<IUnknown **>(g.items.Out())),
              S_OK);
    ASSERT_EQ(g.items.As(g.data), S_OK);
    std::vector<OPCITEMDEF> defs(ids.size());
    for (size_t i = 0; i < ids.size(); ++i) {
        defs[i].szItemID = const_cast<wchar_t *>(ids[i]);
        defs[i].bActive = TRUE;
        defs[i].hClient = static_cast<OPCHANDLE>(i + 1);
    }
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    ASSERT_EQ(g.items->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors), S_OK);
    for (size_t i = 0; i < ids.size(); ++i)
        g.handles.push_back(results[i].hServer);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
}
} // namespace

TEST(Streams, DataWithTimeMatchesTheLayout)
{
    TwoItems t;
    HGLOBAL memory = nullptr;
    ASSERT_EQ(OpcStreams::BuildData(true, 5, 9, 2, t.clients, t.values, t.qualities, t.times, &memory), S_OK);
    auto b = Bytes(memory);
    ASSERT_GE(b.size(), 104u);
    EXPECT_EQ(At(b, 0), 104u) << "dwSize";
    EXPECT_EQ(At(b, 4), 2u);
    EXPECT_EQ(At(b, 8), 5u);
    EXPECT_EQ(At(b, 12), 9u);
    EXPECT_EQ(At(b, 16), 0u);
    EXPECT_EQ(At(b, 20), 11u);
    EXPECT_EQ(At(b, 24), 60u) << "first value offset";
    EXPECT_EQ(At(b, 28), 0xC0u);
    EXPECT_EQ(At(b, 32), 1u);
    EXPECT_EQ(At(b, 36), 2u);
    EXPECT_EQ(At(b, 40), 22u);
    EXPECT_EQ(At(b, 44), 76u) << "second value offset";
    EXPECT_EQ(b[60], VT_I4);
    EXPECT_EQ(At(b, 68), 7u);
    EXPECT_EQ(b[76], VT_BSTR);
    EXPECT_EQ(At(b, 92), 6u) << "the BSTR's byte length";
    EXPECT_EQ(memcmp(&b[96], L"abc", 8), 0) << "the characters and the terminator";
}

TEST(Streams, DataAndWriteCompleteMatchTheirLayouts)
{
    TwoItems t;
    HGLOBAL memory = nullptr;
    ASSERT_EQ(OpcStreams::BuildData(false, 5, 0, 2, t.clients, t.values, t.qualities, t.times, &memory), S_OK);
    auto b = Bytes(memory);
    EXPECT_EQ(At(b, 0), 88u);
    EXPECT_EQ(At(b, 20), 11u);
    EXPECT_EQ(At(b, 24), 44u);
    EXPECT_EQ(At(b, 32), 22u);
    EXPECT_EQ(At(b, 36), 60u);

    OPCHANDLE clients[] = {1, 2, 3};
    HRESULT errors[] = {S_OK, OPC_E_BADRIGHTS, S_OK};
    ASSERT_EQ(OpcStreams::BuildWriteComplete(5, 77, 3, clients, errors, &memory), S_OK);
    auto w = Bytes(memory);
    ASSERT_EQ(w.size(), 40u) << "no size field";
    EXPECT_EQ(At(w, 0), 3u);
    EXPECT_EQ(At(w, 4), 5u);
    EXPECT_EQ(At(w, 8), 77u);
    EXPECT_EQ(At(w, 24), 2u);
    EXPECT_EQ(At(w, 28), static_cast<DWORD>(OPC_E_BADRIGHTS));
    EXPECT_NE(OpcStreams::Data(), 0);
    EXPECT_NE(OpcStreams::Data(), OpcStreams::DataTime());
}

TEST(DataObject, AdviseReadWriteAndSubscriptionStreams)
{
    ResetNetwork(); // the described values, whatever ran before
    V1Group g;
    ASSERT_NO_FATAL_FAILURE(
        MakeV1Group(L"v1", 66, {L"\\\\.\\proc1\\Setpoints.temperature", L"\\\\.\\proc1\\Counters.fast"}, g));
    auto &server = g.server;
    auto &data = g.data;
    OPCHANDLE hGroup = g.handle;
    ComPtr<IOPCAsyncIO> async;
    ASSERT_EQ(g.items.As(async), S_OK);
    OPCHANDLE *handles = g.handles.data();
    HRESULT *errors = nullptr;

    FORMATETC timed = {OpcStreams::DataTime(), nullptr, DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
    FORMATETC plain = timed;
    plain.cfFormat = OpcStreams::Data();
    FORMATETC write = timed;
    write.cfFormat = OpcStreams::WriteComplete();
    EXPECT_EQ(data->QueryGetData(&timed), S_OK);
    FORMATETC badIndex = timed;
    badIndex.lindex = 0;
    EXPECT_EQ(data->QueryGetData(&badIndex), DV_E_LINDEX);
    FORMATETC other = timed;
    other.cfFormat = CF_TEXT;
    EXPECT_EQ(data->QueryGetData(&other), DV_E_FORMATETC);

    TestAdviseSink timedSink, plainSink, writeSink;
    DWORD timedId = 0, plainId = 0, writeId = 0;
    ASSERT_EQ(data->DAdvise(&timed, 0, &timedSink, &timedId), S_OK);
    ASSERT_FALSE(timedSink.Streams().empty()) << "DAdvise sends the current values at once";
    EXPECT_EQ(timedSink.Streams()[0].At(12), 0u) << "transaction id 0";
    EXPECT_EQ(timedSink.Streams()[0].At(8), 66u);
    ASSERT_EQ(data->DAdvise(&plain, 0, &plainSink, &plainId), S_OK);
    ASSERT_EQ(data->DAdvise(&write, 0, &writeSink, &writeId), S_OK);
    EXPECT_TRUE(writeSink.Streams().empty());
    EXPECT_EQ(data->DAdvise(&other, 0, &plainSink, &writeId), DV_E_FORMATETC);

    // Subscription changes reach both data formats.
    ASSERT_TRUE(timedSink.WaitFor([](auto &s) { return s.size() >= 3; }));
    ASSERT_TRUE(plainSink.WaitFor([](auto &s) { return s.size() >= 3; }));
    EXPECT_EQ(plainSink.Streams().back().format, OpcStreams::Data());

    DWORD tid = 0;
    EXPECT_EQ(async->Read(timedId, OPC_DS_CACHE, 2, handles, &tid, &errors), S_OK);
    CoTaskMemFree(errors);
    EXPECT_NE(tid, 0u);
    ASSERT_TRUE(timedSink.WaitFor([tid](auto &s) {
        for (const auto &x : s)
            if (x.At(12) == tid)
                return x.At(4) == 2;
        return false;
    }));
    OPCHANDLE mixed[] = {handles[0], 0xBAD};
    EXPECT_EQ(async->Read(timedId, OPC_DS_CACHE, 2, mixed, &tid, &errors), S_FALSE);
    EXPECT_EQ(tid, 0u) << "one invalid handle: no transaction";
    CoTaskMemFree(errors);
    VARIANT v;
    V_VT(&v) = VT_R8;
    V_R8(&v) = 1;
    EXPECT_EQ(async->Write(plainId, 1, handles, &v, &tid, &errors), OLE_E_NOCONNECTION);
    ASSERT_EQ(async->Write(writeId, 1, handles, &v, &tid, &errors), S_OK);
    CoTaskMemFree(errors);
    ASSERT_TRUE(writeSink.WaitFor([tid](auto &s) { return !s.empty() && s.back().At(8) == tid; }));
    EXPECT_EQ(writeSink.Streams().back().bytes.size(), 24u);

    EXPECT_EQ(data->DUnadvise(0xDEAD), E_FAIL);
    EXPECT_EQ(data->DUnadvise(timedId), S_OK);
    EXPECT_EQ(data->DUnadvise(plainId), S_OK);
    EXPECT_EQ(data->DUnadvise(writeId), S_OK);
    EXPECT_EQ(async->Refresh(timedId, OPC_DS_CACHE, &tid), OLE_E_NOCONNECTION);
    server->RemoveGroup(hGroup, TRUE);
}

TEST(DataObject, AdviseKeepsItsOwnTargetDeviceAndARemovedGroupRefusesIt)
{
    V1Group g;
    ASSERT_NO_FATAL_FAILURE(MakeV1Group(L"device", 67, {L"\\\\.\\proc1\\Counters.fast"}, g));
    auto &server = g.server;
    auto &data = g.data;
    OPCHANDLE hGroup = g.handle;

    // The caller's target device is gone once DAdvise returns (as across
    // the process boundary): later notifications carry the group's copy.
    const DWORD size = sizeof(DVTARGETDEVICE) + 16;
    auto *device = static_cast<DVTARGETDEVICE *>(CoTaskMemAlloc(size));
    memset(device, 0x5A, size);
    device->tdSize = size;
    std::vector<BYTE> original(reinterpret_cast<BYTE *>(device), reinterpret_cast<BYTE *>(device) + size);
    FORMATETC timed = {OpcStreams::DataTime(), device, DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
    TestAdviseSink sink;
    DWORD id = 0;
    ASSERT_EQ(data->DAdvise(&timed, 0, &sink, &id), S_OK);
    memset(device, 0xEE, size);
    CoTaskMemFree(device);
    ASSERT_TRUE(sink.WaitFor([](auto &s) { return s.size() >= 3; }));
    EXPECT_EQ(sink.Streams().back().device, original);
    DVTARGETDEVICE tooSmall = {};
    tooSmall.tdSize = 2;
    timed.ptd = &tooSmall;
    DWORD refused = 0;
    EXPECT_EQ(data->DAdvise(&timed, 0, &sink, &refused), DV_E_DVTARGETDEVICE);
    EXPECT_EQ(data->DUnadvise(id), S_OK);

    ASSERT_EQ(server->RemoveGroup(hGroup, FALSE), OPC_S_INUSE);
    timed.ptd = nullptr;
    TestAdviseSink late;
    id = 0;
    EXPECT_EQ(data->DAdvise(&timed, 0, &late, &id), E_FAIL) << "a group whose removal has begun";
    EXPECT_EQ(id, 0u);
    EXPECT_TRUE(late.Streams().empty());
}
