#pragma once
// Owning holder of a VARIANT, and the types whose values own nothing.
#include <windows.h>

#include <oleauto.h>

// Owns a VARIANT; cleared on destruction.
class CVariant {
public:
    CVariant() { VariantInit(&m_v); }
    ~CVariant() { VariantClear(&m_v); }
    CVariant(const CVariant &) = delete;
    CVariant &operator=(const CVariant &) = delete;

    VARIANT *Get() { return &m_v; }
    const VARIANT &Value() const { return m_v; }
    // Hands the value over and leaves this VT_EMPTY.
    VARIANT Detach()
    {
        VARIANT v = m_v;
        VariantInit(&m_v);
        return v;
    }

private:
    VARIANT m_v;
};

// True for the types whose values own nothing (numbers, dates, booleans,
// codes): a VARIANT of one is copied and cleared as plain bytes.
inline bool IsPlainType(VARTYPE type)
{
    switch (type) {
    case VT_EMPTY:
    case VT_NULL:
    case VT_I1:
    case VT_UI1:
    case VT_I2:
    case VT_UI2:
    case VT_I4:
    case VT_UI4:
    case VT_INT:
    case VT_UINT:
    case VT_I8:
    case VT_UI8:
    case VT_R4:
    case VT_R8:
    case VT_CY:
    case VT_DATE:
    case VT_BOOL:
    case VT_ERROR:
    case VT_DECIMAL:
        return true;
    default:
        return false;
    }
}

// A value that owns nothing: the scan and the network's updates copy and
// clear these for every item without calls into OLE Automation.
inline bool IsPlainVariant(const VARIANT &value)
{
    return IsPlainType(V_VT(&value));
}
