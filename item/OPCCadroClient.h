#pragma once
// The bridge from the Cadro network's real-time data to the items: one per
// process while any server object exists.
#include "RefCounted.h"

class OPCCadroClient : public CRefCounted {
public:
    static OPCCadroClient *Create();

    // Opens the network's real-time session.
    HRESULT Init();
    // Ends the session; no callback arrives afterwards.
    void Shutdown();

private:
    OPCCadroClient() = default;

    bool m_open = false;
};
