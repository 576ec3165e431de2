#pragma once
// The receiver of the Cadro network's browse notifications: one per process
// while any server object exists.
#include "RefCounted.h"

class OPCCadroBrowser : public CRefCounted {
public:
    static OPCCadroBrowser *Create();

    // Opens the network's browse session.
    HRESULT Init();
    // Ends the session; no notification arrives afterwards.
    void Shutdown();

private:
    OPCCadroBrowser() = default;

    bool m_open = false;
};
