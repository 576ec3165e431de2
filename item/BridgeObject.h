#pragma once
// Reference counting of the two bridge objects to the network
// (OPCCadroClient, OPCCadroBrowser): one process-wide lock guards both counts.
#include "SyncObject.h"

#include <windows.h>

class CBridgeObject {
public:
    ULONG BridgeAddRef()
    {
        CSingleLock lock(&Lock());
        return static_cast<ULONG>(++m_refs);
    }
    ULONG BridgeRelease()
    {
        LONG refs;
        {
            CSingleLock lock(&Lock());
            refs = --m_refs;
        }
        if (refs == 0)
            delete this; // the held interfaces were released by Free
        return static_cast<ULONG>(refs);
    }

protected:
    CBridgeObject() = default;
    virtual ~CBridgeObject() = default;

private:
    static CCriticalSection &Lock()
    {
        static CCriticalSection lock;
        return lock;
    }
    LONG m_refs = 0;
};
