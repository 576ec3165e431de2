#pragma once
// Intrusive reference count for internal objects that are not COM objects.
#include <windows.h>

class CRefCounted {
public:
    ULONG AddRef() { return static_cast<ULONG>(InterlockedIncrement(&m_refs)); }
    ULONG Release()
    {
        LONG refs = InterlockedDecrement(&m_refs);
        if (refs == 0)
            delete this;
        return static_cast<ULONG>(refs);
    }

protected:
    CRefCounted() = default;
    virtual ~CRefCounted() = default;
    CRefCounted(const CRefCounted &) = delete;
    CRefCounted &operator=(const CRefCounted &) = delete;

private:
    volatile LONG m_refs = 0;
};
