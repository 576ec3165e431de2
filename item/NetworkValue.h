#pragma once
// A value as the network gives it (empty, boolean, number or text) in 16
// bytes instead of a VARIANT's 24: the type and the 8 bytes of its data. An
// item keeps two, and a plant has tens of thousands of items.
//
// Every type whose data fits in those 8 bytes can be held. VT_DECIMAL and
// VT_RECORD, which the network never gives, cannot: taking one leaves
// VT_ERROR with DISP_E_TYPEMISMATCH, as a failed copy does.
//
// Packed to 10 bytes on 2-byte boundaries, so that an item lays its other
// small fields where the padding would be; the data is only ever copied
// with memcpy.
#include "ValueConversion.h"
#include "Variant.h"

#include <cstdint>
#include <cstring>
#include <oleauto.h>

#pragma pack(push, 2)
class CNetworkValue {
public:
    CNetworkValue() = default;
    ~CNetworkValue() { Clear(); }
    CNetworkValue(const CNetworkValue &) = delete;
    CNetworkValue &operator=(const CNetworkValue &) = delete;

    // A VARIANT that borrows the data: read it, copy it, never clear it.
    // Built inline (no call into the platform): the scan views every active
    // item's values at every period.
    VARIANT View() const
    {
        VARIANT v = {};
        V_VT(&v) = m_type;
        memcpy(&V_UI8(&v), &m_data, sizeof m_data);
        return v;
    }

    // Takes over what value holds and leaves it VT_EMPTY.
    void Take(VARIANT &value)
    {
        Clear();
        VARTYPE type = V_VT(&value);
        if (type == VT_DECIMAL || (type & ~VT_BYREF) == VT_RECORD) { // 16 bytes of data
            VariantClear(&value);
            m_type = VT_ERROR;
            m_data = static_cast<uint32_t>(DISP_E_TYPEMISMATCH);
            return;
        }
        m_type = type;
        memcpy(&m_data, &V_UI8(&value), sizeof m_data);
        V_VT(&value) = VT_EMPTY; // VariantInit's whole work, without a call per update
    }

    // By the copy rule of CopyVariant: a failed copy leaves VT_ERROR
    // holding the failure code.
    HRESULT CopyFrom(const CNetworkValue &other)
    {
        VARIANT copy = {};
        HRESULT hr = CopyVariant(&copy, other.View());
        Take(copy);
        return hr;
    }

private:
    void Clear()
    {
        if (!IsPlainType(m_type)) {
            VARIANT v = View();
            VariantClear(&v);
        }
        m_type = VT_EMPTY;
        m_data = 0;
    }

    VARTYPE m_type = VT_EMPTY;
    uint64_t m_data = 0;
};
#pragma pack(pop)
static_assert(sizeof(CNetworkValue) == 10, "a network value is its type and 8 bytes of data");
