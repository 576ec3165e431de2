#include "ValueConversion.h"
#include "NetworkValue.h"

#include <gtest/gtest.h>

namespace {
struct Var : CVariant {
    Var() = default;
    explicit Var(double d)
    {
        V_VT(Get()) = VT_R8;
        V_R8(Get()) = d;
    }
    explicit Var(const wchar_t *s)
    {
        V_VT(Get()) = VT_BSTR;
        V_BSTR(Get()) = s ? SysAllocString(s) : nullptr;
    }
};
} // namespace

TEST(ValueConversion, TypeMapsFollowTheNetworkTypes)
{
    EXPECT_EQ(NetworkTypeToVarType(kCadroNarrowText), VT_BSTR);
    EXPECT_EQ(NetworkTypeToVarType(kCadroWideText), VT_BSTR);
    EXPECT_EQ(NetworkTypeToVarType(kCadroCleared), VT_NULL);
    EXPECT_EQ(NetworkTypeToVarType(4), VT_EMPTY);
    EXPECT_EQ(VarTypeToNetworkType(VT_ARRAY | VT_I4), kCadroNumber);
    EXPECT_EQ(VarTypeToNetworkType(VT_UI4), kCadroNoValue);
    EXPECT_EQ(NormalizedType(VT_UI4), VT_EMPTY);
    EXPECT_EQ(NormalizedType(VT_DECIMAL), VT_R8);
    EXPECT_EQ(NormalizedType(VT_BSTR), VT_BSTR);
    EXPECT_EQ(NormalizedType(VT_BOOL | VT_BYREF), VT_BOOL);
}

TEST(ValueConversion, RecordsBecomeVariantsAndBack)
{
    CadroValue b = {};
    b.type = kCadroBoolean;
    b.boolean = 2;
    Var out;
    EXPECT_EQ(CadroValueToVariant(b, out.Get()), S_OK);
    EXPECT_EQ(V_VT(out.Get()), VT_BOOL);
    EXPECT_EQ(V_BOOL(out.Get()), VARIANT_TRUE);
    CCadroValue back;
    EXPECT_EQ(VariantToCadroValue(out.Value(), back), S_OK);
    EXPECT_EQ(back.Value().type, kCadroBoolean);
    EXPECT_EQ(back.Value().boolean, 1);

    CadroValue emptyWide = {};
    emptyWide.type = kCadroWideText;
    EXPECT_EQ(CadroValueToVariant(emptyWide, out.Get()), S_OK);
    ASSERT_EQ(V_VT(out.Get()), VT_BSTR);
    EXPECT_EQ(SysStringLen(V_BSTR(out.Get())), 0u);
    EXPECT_EQ(VariantToCadroValue(out.Value(), back), S_OK);
    EXPECT_EQ(back.Value().type, kCadroWideText);
    EXPECT_EQ(back.Value().text, nullptr) << "an empty text has no object";

    Var text(L"hello");
    EXPECT_EQ(VariantToCadroValue(text.Value(), back), S_OK);
    ASSERT_EQ(back.Value().type, kCadroWideText);
    ASSERT_NE(back.Value().text, nullptr);
    EXPECT_EQ(CadroValueToVariant(back.Value(), out.Get()), S_OK);
    EXPECT_STREQ(V_BSTR(out.Get()), L"hello");

    Var i4;
    V_VT(i4.Get()) = VT_I4;
    V_I4(i4.Get()) = 5;
    EXPECT_EQ(VariantToCadroValue(i4.Value(), back), S_OK);
    EXPECT_EQ(back.Value().type, kCadroNumber);
    EXPECT_EQ(back.Value().number, 5.0);

    Var unsupported;
    V_VT(unsupported.Get()) = VT_UI4; // no network form: normalized to VT_EMPTY
    V_UI4(unsupported.Get()) = 9;
    EXPECT_EQ(VariantToCadroValue(unsupported.Value(), back), S_OK);
    EXPECT_EQ(back.Value().type, kCadroCleared);

    CadroValue odd = {};
    odd.type = 77;
    EXPECT_EQ(CadroValueToVariant(odd, out.Get()), E_FAIL);
    EXPECT_EQ(V_VT(out.Get()), VT_EMPTY);
    CadroValue none = {};
    none.type = kCadroCleared;
    EXPECT_EQ(CadroValueToVariant(none, out.Get()), S_OK);
    EXPECT_EQ(V_VT(out.Get()), VT_EMPTY);
}

TEST(ValueConversion, ConvertibilityUsesAZeroValue)
{
    EXPECT_EQ(IsConvertible(VT_R8, VT_BSTR), S_OK);
    EXPECT_EQ(IsConvertible(VT_R8, VT_I2), S_OK);
    EXPECT_EQ(IsConvertible(VT_R8, VT_BOOL), S_OK);
    EXPECT_EQ(IsConvertible(VT_BSTR, VT_BSTR), S_OK);
    EXPECT_TRUE(FAILED(IsConvertible(VT_BSTR, VT_R8))) << "an empty text is no number";
    EXPECT_TRUE(FAILED(IsConvertible(VT_R8, VT_DISPATCH)));
    EXPECT_TRUE(FAILED(IsConvertible(VT_R8, 0x7FFF)));
    // Every VARTYPE can be asked about without harm.
    for (unsigned vt = 0; vt <= 0xFFFF; vt += 7)
        IsConvertible(VT_R8, static_cast<VARTYPE>(vt));
}

TEST(ValueConversion, EqualityComparesTypeThenValue)
{
    Var a(1.0), b(1.0);
    EXPECT_TRUE(VariantEquals(a.Value(), b.Value()));
    Var r4;
    V_VT(r4.Get()) = VT_R4;
    V_R4(r4.Get()) = 1.0f;
    EXPECT_FALSE(VariantEquals(a.Value(), r4.Value()));
    Var s1(L"A"), s2(L"A"), s3(L"B"), nullText(nullptr), emptyText(L"");
    EXPECT_TRUE(VariantEquals(s1.Value(), s2.Value()));
    EXPECT_FALSE(VariantEquals(s1.Value(), s3.Value()));
    EXPECT_TRUE(VariantEquals(nullText.Value(), emptyText.Value())) << "both have no bytes";
    Var d1, d2;
    V_VT(d1.Get()) = V_VT(d2.Get()) = VT_DATE;
    V_DATE(d1.Get()) = V_DATE(d2.Get()) = 45000.0;
    EXPECT_FALSE(VariantEquals(d1.Value(), d2.Value())) << "dates never compare equal";
    EXPECT_TRUE(VariantEquals(d1.Value(), d1.Value())) << "the same object";
    Var e1, e2;
    EXPECT_TRUE(VariantEquals(e1.Value(), e2.Value()));
}

TEST(ValueConversion, ClientConversionsReportOverflowAndMismatch)
{
    Var big(1e10);
    EXPECT_EQ(VariantChangeType(big.Get(), big.Get(), 0, VT_I2), DISP_E_OVERFLOW);
    Var nullText(nullptr);
    EXPECT_EQ(VariantChangeType(nullText.Get(), nullText.Get(), 0, VT_R8), DISP_E_TYPEMISMATCH);
    Var target;
    EXPECT_EQ(CopyVariant(target.Get(), Var(2.5).Value()), S_OK);
    EXPECT_EQ(V_R8(target.Get()), 2.5);
    Var moved;
    MoveVariant(moved.Get(), target.Get());
    EXPECT_EQ(V_VT(target.Get()), VT_EMPTY);
    EXPECT_EQ(V_R8(moved.Get()), 2.5);

    // Copies between owning and plain values keep owning copies: text over
    // a number is a copy of its own, and a number over text frees the text.
    Var text(L"pump");
    EXPECT_EQ(CopyVariant(moved.Get(), text.Value()), S_OK);
    ASSERT_EQ(V_VT(moved.Get()), VT_BSTR);
    EXPECT_NE(V_BSTR(moved.Get()), V_BSTR(text.Get()));
    EXPECT_STREQ(V_BSTR(moved.Get()), L"pump");
    EXPECT_EQ(CopyVariant(moved.Get(), Var(7.0).Value()), S_OK);
    EXPECT_EQ(V_VT(moved.Get()), VT_R8);
    EXPECT_TRUE(IsPlainVariant(moved.Value()));
    EXPECT_FALSE(IsPlainVariant(text.Value()));
    CadroValue number = {};
    number.type = kCadroNumber;
    number.number = 3;
    EXPECT_EQ(CadroValueToVariant(number, text.Get()), S_OK); // the text is freed, not overwritten
    EXPECT_EQ(V_R8(text.Get()), 3.0);
}

TEST(ValueConversion, NetworkValuesOwnTheirTextAndCopyDeeply)
{
    CNetworkValue device, last;
    Var text(L"pump running");
    device.Take(*text.Get());
    EXPECT_EQ(V_VT(text.Get()), VT_EMPTY) << "taken over, not copied";
    VARIANT held = device.View();
    ASSERT_EQ(V_VT(&held), VT_BSTR);
    EXPECT_STREQ(V_BSTR(&held), L"pump running");

    ASSERT_EQ(last.CopyFrom(device), S_OK);
    VARIANT copy = last.View();
    EXPECT_NE(V_BSTR(&copy), V_BSTR(&held)) << "a copy of its own";
    EXPECT_TRUE(VariantEquals(copy, held));
    Var number(21.5);
    device.Take(*number.Get()); // frees the text it held
    copy = last.View();
    EXPECT_STREQ(V_BSTR(&copy), L"pump running");
    ASSERT_EQ(last.CopyFrom(device), S_OK); // number over text
    copy = last.View();
    EXPECT_EQ(V_R8(&copy), 21.5);
    EXPECT_FALSE(VariantEquals(copy, Var(21.25).Value()));

    // What does not fit in 8 bytes is refused as a failed copy is.
    VARIANT decimal;
    VariantInit(&decimal);
    V_VT(&decimal) = VT_DECIMAL;
    V_DECIMAL(&decimal).Lo64 = 7;
    device.Take(decimal);
    held = device.View();
    EXPECT_EQ(V_VT(&held), VT_ERROR);
    EXPECT_EQ(V_ERROR(&held), DISP_E_TYPEMISMATCH);
}
