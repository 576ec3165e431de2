#pragma once
// Values between the network's CadroValue record, the item's VARIANTs in the
// canonical type and VARIANTs in the client's requested type. Every VARIANT
// conversion is VariantChangeType with flags 0 and no locale.
#include "CadroNetwork.h"
#include "Variant.h"

#include <oleauto.h>

// Owns a CadroValue record: created cleared (type 1); clearing releases a
// text object.
class CCadroValue {
public:
    CCadroValue()
    {
        m_value.type = kCadroCleared;
        m_value.number = 0;
    }
    ~CCadroValue() { Clear(); }
    CCadroValue(const CCadroValue &) = delete;
    CCadroValue &operator=(const CCadroValue &) = delete;

    void Clear();
    CadroValue *Get() { return &m_value; }
    const CadroValue &Value() const { return m_value; }

private:
    CadroValue m_value;
};

VARTYPE NetworkTypeToVarType(uint16_t networkType);
uint16_t VarTypeToNetworkType(VARTYPE vt);
// The type a VARTYPE becomes through both maps (numbers become VT_R8).
VARTYPE NormalizedType(VARTYPE vt);

HRESULT CadroValueToVariant(const CadroValue &value, VARIANT *out);
HRESULT VariantToCadroValue(const VARIANT &value, CCadroValue &out);
// S_OK when a zero value of canonical converts to requested.
HRESULT IsConvertible(VARTYPE canonical, VARTYPE requested);
bool VariantEquals(const VARIANT &a, const VARIANT &b);

// The copy rule: clear the target, VariantCopy; a failed copy leaves VT_ERROR
// holding the failure code.
HRESULT CopyVariant(VARIANT *target, const VARIANT &source);
// Moves the 16 bytes and leaves the source VT_EMPTY.
void MoveVariant(VARIANT *target, VARIANT *source);
