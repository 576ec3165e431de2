#pragma once
// Owning holder of a VARIANT.
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
