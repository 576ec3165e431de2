// Pieces of the opc command-line client: its reading of the DA 1.0 data
// streams (which come from another process and are checked before use), its
// arguments, and how it shows types, qualities, times and values.
#include "Arguments.h"
#include "Connection.h"
#include "DataStream.h"
#include "Format.h"
#include "StreamBuilder.h"
#include "Variant.h"

#include <gtest/gtest.h>

#include <cstring>
#include <vector>

namespace {
std::vector<BYTE> TwoItemStream(bool withTime)
{
    OPCHANDLE clients[2] = {11, 22};
    CVariant values[2];
    V_VT(values[0].Get()) = VT_I4;
    V_I4(values[0].Get()) = -7;
    V_VT(values[1].Get()) = VT_BSTR;
    V_BSTR(values[1].Get()) = SysAllocString(L"abc");
    VARIANT raw[2] = {values[0].Value(), values[1].Value()};
    WORD qualities[2] = {0xC0, 0x18};
    FILETIME times[2] = {{1, 2}, {3, 4}};
    HGLOBAL memory = nullptr;
    EXPECT_EQ(OpcStreams::BuildData(withTime, 5, 9, 2, clients, raw, qualities, times, &memory), S_OK);
    SIZE_T size = GlobalSize(memory);
    const BYTE *p = static_cast<const BYTE *>(GlobalLock(memory));
    std::vector<BYTE> bytes(p, p + size);
    GlobalUnlock(memory);
    GlobalFree(memory);
    return bytes;
}

void PutDword(std::vector<BYTE> &bytes, size_t offset, DWORD value)
{
    memcpy(&bytes[offset], &value, 4);
}
} // namespace

TEST(OpcClient, ReadsWhatTheServerWritesAndRefusesStreamsThatDoNotHoldTogether)
{
    for (bool withTime : {true, false}) {
        std::vector<BYTE> bytes = TwoItemStream(withTime);
        DataStream stream;
        ASSERT_TRUE(ReadDataStream(bytes.data(), bytes.size(), withTime, stream));
        EXPECT_EQ(stream.groupClient, 5u);
        EXPECT_EQ(stream.transactionId, 9u);
        ASSERT_EQ(stream.items.size(), 2u);
        EXPECT_EQ(stream.items[0].client, 11u);
        EXPECT_EQ(V_VT(&stream.items[0].value), VT_I4);
        EXPECT_EQ(V_I4(&stream.items[0].value), -7);
        EXPECT_EQ(stream.items[1].quality, 0x18);
        ASSERT_EQ(V_VT(&stream.items[1].value), VT_BSTR);
        EXPECT_STREQ(V_BSTR(&stream.items[1].value), L"abc");
        if (withTime) {
            EXPECT_EQ(stream.items[1].time.dwHighDateTime, 4u);
        }
        // Read as the other layout it does not hold together.
        EXPECT_FALSE(ReadDataStream(bytes.data(), bytes.size(), !withTime, stream) && stream.items.size() == 2 &&
                     V_VT(&stream.items[1].value) == VT_BSTR);
    }

    std::vector<BYTE> good = TwoItemStream(true);
    DataStream stream;
    for (size_t cut : {size_t(0), size_t(19), size_t(40), good.size() - 1}) // truncated anywhere
        EXPECT_FALSE(ReadDataStream(good.data(), cut, true, stream)) << cut;
    std::vector<BYTE> bad = good;
    PutDword(bad, 4, 0x10000000); // item count far beyond the size
    EXPECT_FALSE(ReadDataStream(bad.data(), bad.size(), true, stream));
    bad = good;
    PutDword(bad, 20 + 20 + 4, 0xFFFFFFF0); // a value offset outside the stream
    EXPECT_FALSE(ReadDataStream(bad.data(), bad.size(), true, stream));
    bad = good;
    PutDword(bad, 76 + 16, 0x7FFFFFFE); // a string longer than the stream
    EXPECT_FALSE(ReadDataStream(bad.data(), bad.size(), true, stream));
    bad = good;
    PutDword(bad, 60, VT_UNKNOWN); // a pointer from another process is not taken
    ASSERT_TRUE(ReadDataStream(bad.data(), bad.size(), true, stream));
    EXPECT_EQ(V_VT(&stream.items[0].value), VT_EMPTY);
}

TEST(OpcClient, ArgumentsAndHowValuesAreShown)
{
    Arguments args;
    std::wstring error;
    ASSERT_TRUE(args.Parse({L"write", L"-s", L"X.Y", L"item", L"-5.5", L"--type=r8", L"--json"}, error));
    EXPECT_EQ(args.Command(), L"write");
    EXPECT_EQ(args.Positional(), (std::vector<std::wstring>{L"item", L"-5.5"})); // a negative number is a value
    EXPECT_EQ(args.Value(L"server"), L"X.Y");
    EXPECT_EQ(args.Value(L"type"), L"r8");
    EXPECT_EQ(args.Unknown({L"server", L"type", L"json"}), L"");
    EXPECT_EQ(args.Unknown({L"server", L"type"}), L"--json");
    Arguments missing;
    EXPECT_FALSE(missing.Parse({L"read", L"--source"}, error));

    VARTYPE type = VT_EMPTY;
    EXPECT_TRUE(ParseTypeName(L"VT_R8", type));
    EXPECT_EQ(type, VT_R8);
    EXPECT_TRUE(ParseTypeName(L"int32[]", type));
    EXPECT_EQ(type, VT_I4 | VT_ARRAY);
    EXPECT_FALSE(ParseTypeName(L"real", type));
    EXPECT_EQ(TypeName(VT_UI2), L"uint16");

    EXPECT_EQ(QualityText(0xC0), L"good");
    EXPECT_EQ(QualityText(0x1C), L"bad (out of service)");
    EXPECT_EQ(QualityText(0x45), L"uncertain (last usable value), low limited");
    EXPECT_EQ(LocalTimeText(FILETIME{0, 0}), L"");
    std::wstring stamp = LocalTimeText(FILETIME{0xDB9BE000u, 0x01D52371u}); // 2019-06-15 12:00 UTC
    ASSERT_EQ(stamp.size(), 29u) << stamp;
    EXPECT_EQ(stamp.substr(0, 11), L"2019-06-15T");
    EXPECT_EQ(stamp[10], L'T');
    EXPECT_TRUE(stamp[23] == L'+' || stamp[23] == L'-');

    CVariant text;
    V_VT(text.Get()) = VT_BSTR;
    V_BSTR(text.Get()) = SysAllocString(L"a\"b\\c\n");
    EXPECT_EQ(ValueJson(text.Value()), L"\"a\\\"b\\\\c\\n\"");
    CVariant number;
    V_VT(number.Get()) = VT_R8;
    V_R8(number.Get()) = 1.5;
    EXPECT_EQ(ValueText(number.Value()), L"1.5");
    V_R8(number.Get()) = 0.0 / 0.0;
    EXPECT_EQ(ValueJson(number.Value()), L"\"NaN\"");
    CVariant flag;
    V_VT(flag.Get()) = VT_BOOL;
    V_BOOL(flag.Get()) = VARIANT_TRUE;
    EXPECT_EQ(ValueJson(flag.Value()), L"true");

    SAFEARRAY *array = SafeArrayCreateVector(VT_I2, 0, 3);
    for (LONG i = 0; i < 3; ++i) {
        SHORT v = static_cast<SHORT>(i * 10);
        SafeArrayPutElement(array, &i, &v);
    }
    CVariant list;
    V_VT(list.Get()) = VT_ARRAY | VT_I2;
    V_ARRAY(list.Get()) = array;
    EXPECT_EQ(ValueJson(list.Value()), L"[0,10,20]");
    EXPECT_EQ(ValueText(list.Value()), L"[0, 10, 20]");
}

TEST(OpcClient, OnlyAServerThatStoppedOrVanishedIsAskedAgain)
{
    for (HRESULT transient : {CO_E_SERVER_STOPPING, HRESULT_FROM_WIN32(RPC_S_SERVER_UNAVAILABLE),
                              HRESULT_FROM_WIN32(RPC_S_CALL_FAILED), HRESULT_FROM_WIN32(RPC_S_CALL_FAILED_DNE),
                              RPC_E_DISCONNECTED, E_NOINTERFACE, HRESULT_FROM_WIN32(ERROR_NOACCESS)})
        EXPECT_TRUE(Connection::IsTransient(transient)) << std::hex << transient;
    for (HRESULT final : {S_OK, REGDB_E_CLASSNOTREG, E_ACCESSDENIED, E_OUTOFMEMORY, CO_E_SERVER_EXEC_FAILURE, E_FAIL})
        EXPECT_FALSE(Connection::IsTransient(final)) << std::hex << final;
}
