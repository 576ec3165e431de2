#pragma once
// Keeps the interfaces a server process exports registered with the RPC
// runtime for as long as the process serves.
//
// COM registers an interface with the RPC runtime when the process makes its
// first stub for it and unregisters it, waiting for the calls on it to end,
// when the last such stub goes. On Wine that wait can miss its wake-up when a
// call on the interface is just ending (the runtime reads the call count
// before the ending call lowers it): the releasing thread then waits forever
// holding COM's registration lock, and every later marshalling in the process
// waits behind it. A client that releases its last group while another
// thread's call on a group returns would freeze the server that way. A stub
// that never goes keeps every interface registered, so the runtime never
// unregisters one while clients come and go: the anchor marshals one inert
// object, table-strong, for every exported interface. It holds no server
// object and does not count in the server's lifetime.
#include "ComPtr.h"

#include <objidl.h>

#include <memory>
#include <vector>

class CInterfaceAnchor {
public:
    CInterfaceAnchor();
    ~CInterfaceAnchor();
    CInterfaceAnchor(const CInterfaceAnchor &) = delete;
    CInterfaceAnchor &operator=(const CInterfaceAnchor &) = delete;

    // Marshals the anchor for each interface (IUnknown is always included);
    // the first failure, after trying them all. The interfaces that succeeded
    // stay held.
    HRESULT Hold(const std::vector<const IID *> &iids);
    // Releases every marshal (before COM is uninitialised).
    void Release();
    size_t HeldCount() const { return m_marshals.size(); }

private:
    HRESULT HoldOne(REFIID iid);

    struct Inert;
    std::unique_ptr<Inert> m_inert;
    std::vector<ComPtr<IStream>> m_marshals;
};
