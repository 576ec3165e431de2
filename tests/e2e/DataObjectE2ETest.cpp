// A DA 1.0 client across the process boundary: IAdviseSink connections of
// the three stream formats receive streams it parses.
#include "ComPtr.h"
#include "OpcErrors.h"
#include "ServerProcess.h"
#include "TestAdviseSink.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <cstring>

namespace {
double ValueAt(const ReceivedStream &s, size_t valueOffset)
{
    if (valueOffset + 16 > s.bytes.size() || s.bytes[valueOffset] != VT_R8)
        return -1;
    double d;
    memcpy(&d, &s.bytes[valueOffset + 8], 8);
    return d;
}
} // namespace

TEST(DataObjectE2E, StreamsOfAllThreeFormatsReachTheClient)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    TestAdviseSink timedSink, plainSink, writeSink;
    {
        ComPtr<IOPCServer> server;
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
        OPCHANDLE hGroup;
        DWORD rate;
        ComPtr<IOPCItemMgt> items;
        ASSERT_EQ(server->AddGroup(L"v1", TRUE, 100, 3, nullptr, nullptr, 0, &hGroup, &rate, IID_IOPCItemMgt,
                                   reinterpret_cast<IUnknown **>(items.Out())),
                  S_OK);
        OPCITEMDEF def = {};
        def.szItemID = const_cast<wchar_t *>(L"\\\\.\\proc1\\Setpoints.temperature");
        def.bActive = TRUE;
        def.hClient = 9;
        OPCITEMRESULT *results = nullptr;
        HRESULT *errors = nullptr;
        ASSERT_EQ(items->AddItems(1, &def, &results, &errors), S_OK);
        OPCHANDLE h = results[0].hServer;
        CoTaskMemFree(results);
        CoTaskMemFree(errors);

        ComPtr<IDataObject> data;
        ComPtr<IOPCAsyncIO> async;
        ASSERT_EQ(items.As(data), S_OK);
        ASSERT_EQ(items.As(async), S_OK);
        CLIPFORMAT cfTimed = static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATATIME"));
        CLIPFORMAT cfPlain = static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATA"));
        CLIPFORMAT cfWrite = static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATWRITECOMPLETE"));
        FORMATETC timed = {cfTimed, nullptr, DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
        FORMATETC plain = timed, write = timed;
        plain.cfFormat = cfPlain;
        write.cfFormat = cfWrite;
        DWORD timedId = 0, plainId = 0, writeId = 0;
        ASSERT_EQ(data->DAdvise(&timed, 0, &timedSink, &timedId), S_OK);
        ASSERT_EQ(data->DAdvise(&plain, 0, &plainSink, &plainId), S_OK);
        ASSERT_EQ(data->DAdvise(&write, 0, &writeSink, &writeId), S_OK);

        // The current value, with time stamps: one item, value after the headers.
        ASSERT_TRUE(timedSink.WaitFor([](auto &s) { return !s.empty(); }));
        ReceivedStream first = timedSink.Streams()[0];
        EXPECT_EQ(first.format, cfTimed);
        EXPECT_EQ(first.At(0), 56u) << "20-byte group header, 20-byte item header, 16-byte value";
        EXPECT_EQ(first.At(4), 1u);
        EXPECT_EQ(first.At(8), 3u);
        EXPECT_EQ(first.At(20), 9u);
        EXPECT_EQ(first.At(24), 40u);
        EXPECT_EQ(ValueAt(first, 40), 21.5);

        std::string out;
        EXPECT_EQ(RunCadroctl(L"publish \\\\.\\proc1\\Setpoints.temperature 44", out), 0) << out;
        ASSERT_TRUE(plainSink.WaitFor([](auto &s) {
            for (const auto &x : s)
                if (x.At(4) == 1 && ValueAt(x, x.At(24)) == 44)
                    return x.At(12) == 0;
            return false;
        })) << "the data format (12-byte item headers) carries the change";

        DWORD tid = 0;
        ASSERT_EQ(async->Read(timedId, OPC_DS_DEVICE, 1, &h, &tid, &errors), S_OK);
        CoTaskMemFree(errors);
        ASSERT_TRUE(timedSink.WaitFor([tid](auto &s) {
            for (const auto &x : s)
                if (x.At(12) == tid)
                    return ValueAt(x, x.At(24)) == 44;
            return false;
        }));
        VARIANT v;
        V_VT(&v) = VT_R8;
        V_R8(&v) = 5;
        ASSERT_EQ(async->Write(writeId, 1, &h, &v, &tid, &errors), S_OK);
        CoTaskMemFree(errors);
        ASSERT_TRUE(writeSink.WaitFor([tid](auto &s) {
            return !s.empty() && s.back().bytes.size() == 24 && s.back().At(8) == tid && s.back().At(16) == 9 &&
                   s.back().At(20) == S_OK;
        }));
        EXPECT_EQ(data->DUnadvise(timedId), S_OK);
        EXPECT_EQ(data->DUnadvise(plainId), S_OK);
        EXPECT_EQ(data->DUnadvise(writeId), S_OK);
    }
    EXPECT_TRUE(WaitForNoServerProcess(20000));
    for (IAdviseSink *sink : {static_cast<IAdviseSink *>(&timedSink), static_cast<IAdviseSink *>(&plainSink),
                              static_cast<IAdviseSink *>(&writeSink)})
        CoDisconnectObject(sink, 0);
}
