#include "Format.h"

#include "Variant.h"

#include <cmath>
#include <cstdio>
#include <cwctype>
#include <iterator>

namespace {
struct TypeEntry {
    VARTYPE type;
    const wchar_t *name;
    const wchar_t *alias; // the VARTYPE's own short name
};
const TypeEntry kTypes[] = {
    {VT_EMPTY, L"empty", L"empty"},
    {VT_BOOL, L"bool", L"bool"},
    {VT_I1, L"int8", L"i1"},
    {VT_UI1, L"uint8", L"ui1"},
    {VT_I2, L"int16", L"i2"},
    {VT_UI2, L"uint16", L"ui2"},
    {VT_I4, L"int32", L"i4"},
    {VT_UI4, L"uint32", L"ui4"},
    {VT_I8, L"int64", L"i8"},
    {VT_UI8, L"uint64", L"ui8"},
    {VT_R4, L"float", L"r4"},
    {VT_R8, L"double", L"r8"},
    {VT_CY, L"currency", L"cy"},
    {VT_DATE, L"date", L"date"},
    {VT_BSTR, L"string", L"bstr"},
    {VT_ERROR, L"error", L"error"},
    {VT_VARIANT, L"variant", L"variant"},
};

std::wstring Lower(std::wstring text)
{
    for (wchar_t &c : text)
        c = static_cast<wchar_t>(std::towlower(c));
    return text;
}

const wchar_t *const kBadStates[] = {L"non-specific",   L"configuration error", L"not connected", L"device failure",
                                     L"sensor failure", L"last known value",    L"comm failure",  L"out of service"};
const wchar_t *UncertainState(int sub)
{
    switch (sub) {
    case 1:
        return L"last usable value";
    case 4:
        return L"sensor not accurate";
    case 5:
        return L"engineering units exceeded";
    case 6:
        return L"sub-normal";
    default:
        return L"non-specific";
    }
}

std::wstring DateText(DATE date)
{
    SYSTEMTIME st;
    if (!VariantTimeToSystemTime(date, &st))
        return L"";
    wchar_t text[32];
    swprintf(text, std::size(text), L"%04u-%02u-%02uT%02u:%02u:%02u", st.wYear, st.wMonth, st.wDay, st.wHour,
             st.wMinute, st.wSecond);
    return text;
}

// Scalar values as text; quoted says whether strings get JSON quotes.
std::wstring ScalarText(const VARIANT &value, bool json)
{
    switch (V_VT(&value)) {
    case VT_EMPTY:
    case VT_NULL:
        return json ? L"null" : L"";
    case VT_BOOL:
        return V_BOOL(&value) ? L"true" : L"false";
    case VT_BSTR: {
        std::wstring text(V_BSTR(&value) ? V_BSTR(&value) : L"", V_BSTR(&value) ? SysStringLen(V_BSTR(&value)) : 0);
        return json ? JsonString(text) : text;
    }
    case VT_DATE:
        return json ? JsonString(DateText(V_DATE(&value))) : DateText(V_DATE(&value));
    case VT_ERROR:
        return json ? JsonString(HexCode(V_ERROR(&value))) : HexCode(V_ERROR(&value));
    case VT_R4:
    case VT_R8: {
        double d = V_VT(&value) == VT_R4 ? V_R4(&value) : V_R8(&value);
        if (!std::isfinite(d)) {
            std::wstring text = std::isnan(d) ? L"NaN" : d > 0 ? L"Infinity" : L"-Infinity";
            return json ? JsonString(text) : text;
        }
        break;
    }
    default:
        break;
    }
    // Numbers: the platform's conversion in the invariant locale.
    CVariant text;
    if (FAILED(VariantChangeTypeEx(text.Get(), const_cast<VARIANT *>(&value), LOCALE_INVARIANT, 0, VT_BSTR)))
        return json ? L"null" : L"?";
    return V_BSTR(text.Get()) ? V_BSTR(text.Get()) : L"";
}

std::wstring ArrayText(const VARIANT &value, bool json)
{
    SAFEARRAY *array = (V_VT(&value) & VT_BYREF) ? *V_ARRAYREF(&value) : V_ARRAY(&value);
    VARTYPE element = V_VT(&value) & VT_TYPEMASK;
    LONG low = 0, high = -1;
    if (!array || SafeArrayGetDim(array) != 1 || FAILED(SafeArrayGetLBound(array, 1, &low)) ||
        FAILED(SafeArrayGetUBound(array, 1, &high)))
        return json ? L"null" : L"[?]";
    std::wstring text = L"[";
    for (LONG i = low; i <= high; ++i) {
        CVariant item;
        if (element == VT_VARIANT) {
            SafeArrayGetElement(array, &i, item.Get());
        } else {
            V_VT(item.Get()) = element;
            if (FAILED(SafeArrayGetElement(array, &i, &V_UI1(item.Get()))))
                V_VT(item.Get()) = VT_EMPTY;
        }
        if (i != low)
            text += json ? L"," : L", ";
        text += ScalarText(*item.Get(), json);
    }
    return text + L"]";
}
} // namespace

std::wstring TypeName(VARTYPE type)
{
    std::wstring suffix = (type & VT_ARRAY) ? L"[]" : L"";
    VARTYPE base = type & VT_TYPEMASK;
    for (const TypeEntry &entry : kTypes)
        if (entry.type == base)
            return entry.name + suffix;
    wchar_t text[16];
    swprintf(text, std::size(text), L"vt%u", static_cast<unsigned>(base));
    return text + suffix;
}

bool ParseTypeName(const std::wstring &name, VARTYPE &type)
{
    std::wstring text = Lower(name);
    VARTYPE array = 0;
    if (text.size() > 2 && text.compare(text.size() - 2, 2, L"[]") == 0) {
        array = VT_ARRAY;
        text.resize(text.size() - 2);
    }
    if (text.compare(0, 3, L"vt_") == 0)
        text = text.substr(3);
    for (const TypeEntry &entry : kTypes)
        if (text == entry.name || text == entry.alias) {
            type = entry.type | array;
            return true;
        }
    return false;
}

std::wstring QualityText(WORD quality)
{
    int sub = (quality >> 2) & 0x0F;
    std::wstring text;
    switch (quality & 0xC0) {
    case 0xC0:
        text = sub == 6 ? L"good (local override)" : L"good";
        break;
    case 0x40:
        text = sub == 0 ? L"uncertain" : std::wstring(L"uncertain (") + UncertainState(sub) + L")";
        break;
    case 0x00:
        text = sub == 0 ? L"bad" : sub < 8 ? std::wstring(L"bad (") + kBadStates[sub] + L")" : L"bad";
        break;
    default:
        text = L"invalid";
        break;
    }
    static const wchar_t *const limits[] = {L"", L", low limited", L", high limited", L", constant"};
    return text + limits[quality & 3];
}

std::wstring LocalTimeText(const FILETIME &utc)
{
    SYSTEMTIME utcTime, local;
    if ((utc.dwLowDateTime | utc.dwHighDateTime) == 0 || !FileTimeToSystemTime(&utc, &utcTime) ||
        !SystemTimeToTzSpecificLocalTime(nullptr, &utcTime, &local))
        return L"";
    FILETIME localFile;
    SystemTimeToFileTime(&local, &localFile);
    auto ticks = [](const FILETIME &f) {
        return static_cast<LONGLONG>((static_cast<ULONGLONG>(f.dwHighDateTime) << 32) | f.dwLowDateTime);
    };
    LONGLONG offsetMinutes = (ticks(localFile) - ticks(utc)) / (60LL * 10000000LL);
    wchar_t sign = offsetMinutes < 0 ? L'-' : L'+';
    LONGLONG magnitude = offsetMinutes < 0 ? -offsetMinutes : offsetMinutes;
    wchar_t text[48];
    swprintf(text, std::size(text), L"%04u-%02u-%02uT%02u:%02u:%02u.%03u%lc%02lld:%02lld", local.wYear, local.wMonth,
             local.wDay, local.wHour, local.wMinute, local.wSecond, local.wMilliseconds, sign, magnitude / 60,
             magnitude % 60);
    return text;
}

std::wstring ValueText(const VARIANT &value)
{
    return (V_VT(&value) & VT_ARRAY) ? ArrayText(value, false) : ScalarText(value, false);
}

std::wstring ValueJson(const VARIANT &value)
{
    return (V_VT(&value) & VT_ARRAY) ? ArrayText(value, true) : ScalarText(value, true);
}

std::wstring JsonString(const std::wstring &text)
{
    std::wstring out = L"\"";
    for (wchar_t c : text) {
        switch (c) {
        case L'"':
            out += L"\\\"";
            break;
        case L'\\':
            out += L"\\\\";
            break;
        case L'\n':
            out += L"\\n";
            break;
        case L'\r':
            out += L"\\r";
            break;
        case L'\t':
            out += L"\\t";
            break;
        default:
            if (c < 0x20) {
                wchar_t escape[8];
                swprintf(escape, std::size(escape), L"\\u%04x", static_cast<unsigned>(c));
                out += escape;
            } else {
                out += c;
            }
        }
    }
    return out + L"\"";
}

std::wstring HexCode(HRESULT code)
{
    wchar_t text[16];
    swprintf(text, std::size(text), L"0x%08lX", static_cast<unsigned long>(code));
    return text;
}
