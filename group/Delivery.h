#pragma once
// The column arrays of one callback or stream, filled from a read pass or
// the scan's change check. The values are owned and cleared with it.
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "Variant.h"

#include <algorithm>
#include <vector>

struct Delivery {
    static constexpr size_t kKeptRows = 4096;      // never given back below this
    static constexpr unsigned kShrinkCheck = 1000; // scans between two looks
    std::vector<OPCHANDLE> clients;
    std::vector<VARIANT> values;
    std::vector<WORD> qualities;
    std::vector<FILETIME> times;
    std::vector<HRESULT> errors;

    explicit Delivery(size_t n) : clients(n), values(n), qualities(n), times(n), errors(n)
    {
        for (VARIANT &v : values)
            VariantInit(&v);
    }
    // Takes over the values of the results.
    explicit Delivery(std::vector<COPCGroup::ReadResult> &&results) : Delivery(results.size())
    {
        for (size_t i = 0; i < results.size(); ++i) {
            clients[i] = results[i].client;
            values[i] = results[i].value;
            qualities[i] = results[i].quality;
            times[i] = results[i].time;
            errors[i] = results[i].error;
        }
        results.clear();
    }
    ~Delivery()
    {
        for (VARIANT &v : values)
            VariantClear(&v);
    }
    Delivery(const Delivery &) = delete;
    Delivery &operator=(const Delivery &) = delete;

    void Swap(Delivery &other)
    {
        clients.swap(other.clients);
        values.swap(other.values);
        qualities.swap(other.qualities);
        times.swap(other.times);
        errors.swap(other.errors);
    }
    DWORD Count() const { return static_cast<DWORD>(clients.size()); }
    // Makes n rows for reuse; the values must be empty. Rows that no call
    // has needed for kShrinkCheck calls (a large group's, gone since) are
    // given back: a large group scanned in turn with small ones keeps them.
    void Resize(size_t n)
    {
        m_peak = std::max(m_peak, n);
        if (++m_calls == kShrinkCheck) {
            if (m_peak < values.capacity() / 4 && values.capacity() > kKeptRows) {
                Delivery fitted(m_peak);
                Swap(fitted);
            }
            m_calls = 0;
            m_peak = n;
        }
        size_t old = values.size();
        clients.resize(n);
        values.resize(n);
        qualities.resize(n);
        times.resize(n);
        errors.resize(n);
        for (size_t i = old; i < n; ++i)
            VariantInit(&values[i]);
    }
    // Empties the values of the first n rows.
    void ClearValues(size_t n)
    {
        for (size_t i = 0; i < n && i < values.size(); ++i) {
            if (IsPlainVariant(values[i]))
                V_VT(&values[i]) = VT_EMPTY; // owns nothing
            else
                VariantClear(&values[i]);
        }
    }
    // S_OK when the first n qualities are all exactly good.
    HRESULT MasterQuality(size_t n) const
    {
        for (size_t i = 0; i < n; ++i)
            if (qualities[i] != OPC_QUALITY_GOOD)
                return S_FALSE;
        return S_OK;
    }

private:
    size_t m_peak = 0;    // the most rows asked for since the last look
    unsigned m_calls = 0; // calls since then
};
