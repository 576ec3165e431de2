#include "ValueConversion.h"

#include "CodePage.h"

#include <cstring>
#include <string>

void CCadroValue::Clear()
{
    if ((m_value.type & kCadroTextBit) && m_value.text)
        m_value.text->Release();
    m_value.type = kCadroCleared;
    m_value.number = 0;
}

VARTYPE NetworkTypeToVarType(uint16_t networkType)
{
    switch (networkType) {
    case kCadroCleared:
        return VT_NULL;
    case kCadroBoolean:
        return VT_BOOL;
    case kCadroNumber:
        return VT_R8;
    case kCadroNarrowText:
    case kCadroWideText:
        return VT_BSTR;
    default:
        return VT_EMPTY;
    }
}

uint16_t VarTypeToNetworkType(VARTYPE vt)
{
    switch (vt & VT_TYPEMASK) {
    case VT_NULL:
        return kCadroCleared;
    case VT_I2:
    case VT_I4:
    case VT_R4:
    case VT_R8:
    case VT_CY:
    case VT_DATE:
    case VT_DECIMAL:
    case VT_UI1:
        return kCadroNumber;
    case VT_BSTR:
        return kCadroWideText;
    case VT_BOOL:
        return kCadroBoolean;
    default:
        return kCadroNoValue;
    }
}

VARTYPE NormalizedType(VARTYPE vt)
{
    return NetworkTypeToVarType(VarTypeToNetworkType(vt));
}

namespace {
// The characters of a text record's object, through the interface CDDYNAM
// defines for its kind.
bool WideChars(IUnknown *text, std::wstring &out)
{
    ICadroWideText *wide = nullptr;
    if (FAILED(text->QueryInterface(__uuidof(ICadroWideText), reinterpret_cast<void **>(&wide))))
        return false;
    out = wide->Chars();
    wide->Release();
    return true;
}

bool NarrowChars(IUnknown *text, std::wstring &out)
{
    ICadroNarrowText *narrow = nullptr;
    if (FAILED(text->QueryInterface(__uuidof(ICadroNarrowText), reinterpret_cast<void **>(&narrow))))
        return false;
    out = FromCodePage(narrow->Chars());
    narrow->Release();
    return true;
}

void SetText(VARIANT &v, const std::wstring &text)
{
    V_VT(&v) = VT_BSTR;
    V_BSTR(&v) = SysAllocStringLen(text.data(), static_cast<UINT>(text.size()));
    if (!V_BSTR(&v)) {
        V_VT(&v) = VT_ERROR;
        V_ERROR(&v) = E_OUTOFMEMORY;
    }
}

// A text value into an empty VARIANT.
HRESULT TextToVariant(const CadroValue &value, VARIANT &out)
{
    std::wstring text;
    if (value.text && !(value.type == kCadroWideText ? WideChars(value.text, text) : NarrowChars(value.text, text)))
        return E_FAIL; // an object without the text interface of its kind
    SetText(out, text);
    return S_OK;
}
} // namespace

HRESULT CadroValueToVariant(const CadroValue &value, VARIANT *out)
{
    // Numbers and booleans (nearly every update) are written in place,
    // without a call into the platform.
    if (!IsPlainVariant(*out))
        VariantClear(out);
    V_VT(out) = VT_EMPTY;
    switch (value.type) {
    case kCadroNoValue:
    case kCadroCleared:
        return S_OK;
    case kCadroBoolean:
        V_VT(out) = VT_BOOL;
        V_BOOL(out) = value.boolean ? VARIANT_TRUE : VARIANT_FALSE;
        return S_OK;
    case kCadroNumber:
        V_VT(out) = VT_R8;
        V_R8(out) = value.number;
        return S_OK;
    case kCadroWideText:
    case kCadroNarrowText:
        return TextToVariant(value, *out);
    default:
        return E_FAIL;
    }
}

HRESULT VariantToCadroValue(const VARIANT &value, CCadroValue &out)
{
    out.Clear();
    CVariant copy;
    HRESULT hr = VariantCopy(copy.Get(), const_cast<VARIANT *>(&value));
    if (SUCCEEDED(hr))
        hr = VariantChangeType(copy.Get(), copy.Get(), 0, NormalizedType(V_VT(&value)));
    if (FAILED(hr))
        return hr;
    CadroValue &record = *out.Get();
    switch (V_VT(copy.Get()) & VT_TYPEMASK) {
    case VT_EMPTY:
    case VT_NULL:
        return hr;
    case VT_R8:
        record.type = kCadroNumber;
        record.number = V_R8(copy.Get());
        return hr;
    case VT_BOOL:
        record.type = kCadroBoolean;
        record.number = 0;
        record.boolean = V_BOOL(copy.Get()) ? 1 : 0;
        return hr;
    case VT_BSTR: {
        BSTR text = V_BSTR(copy.Get());
        record.type = kCadroWideText;
        record.text = text && *text ? NewUnicodeGuts(text) : nullptr;
        if (text && *text && !record.text) {
            out.Clear();
            return E_OUTOFMEMORY;
        }
        return hr;
    }
    default:
        return E_FAIL;
    }
}

HRESULT IsConvertible(VARTYPE canonical, VARTYPE requested)
{
    VARIANT v;
    memset(&v, 0, sizeof v); // zero data: 0, 0.0, FALSE or a null BSTR
    V_VT(&v) = canonical;
    HRESULT hr = VariantChangeType(&v, &v, 0, requested);
    VariantClear(&v);
    return hr;
}

bool VariantEquals(const VARIANT &a, const VARIANT &b)
{
    if (&a == &b)
        return true;
    if (V_VT(&a) != V_VT(&b))
        return false;
    switch (V_VT(&a)) {
    case VT_EMPTY:
    case VT_NULL:
        return true;
    case VT_I2:
    case VT_BOOL:
    case VT_UI2:
        return V_UI2(&a) == V_UI2(&b);
    case VT_I4:
    case VT_ERROR:
    case VT_UI4:
        return V_UI4(&a) == V_UI4(&b);
    case VT_R4:
        return V_R4(&a) == V_R4(&b);
    case VT_R8:
        return V_R8(&a) == V_R8(&b);
    case VT_BSTR: {
        UINT la = SysStringByteLen(V_BSTR(&a)), lb = SysStringByteLen(V_BSTR(&b));
        return la == lb && (la == 0 || memcmp(V_BSTR(&a), V_BSTR(&b), la) == 0);
    }
    case VT_DISPATCH:
    case VT_UNKNOWN:
        return V_UNKNOWN(&a) == V_UNKNOWN(&b);
    case VT_I1:
    case VT_UI1:
        return V_UI1(&a) == V_UI1(&b);
    default:
        return false; // including every VT_ARRAY and VT_BYREF combination
    }
}

HRESULT CopyVariant(VARIANT *target, const VARIANT &source)
{
    if (IsPlainVariant(source) && IsPlainVariant(*target)) {
        *target = source;
        return S_OK;
    }
    VariantClear(target);
    HRESULT hr = VariantCopy(target, const_cast<VARIANT *>(&source));
    if (FAILED(hr)) {
        V_VT(target) = VT_ERROR;
        V_ERROR(target) = hr;
    }
    return hr;
}

void MoveVariant(VARIANT *target, VARIANT *source)
{
    VariantClear(target);
    *target = *source;
    VariantInit(source);
}
