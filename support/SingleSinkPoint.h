#pragma once
// A connection point with room for one sink, for containers that keep the
// sink themselves (the group's IOPCDataCallback, the server's IOPCShutdown).
// It is part of its container: the same object at every request, with an
// identity of its own but its container's reference count (it must answer
// GetConnectionPointContainer, and owning the container would be a cycle).
#include "ComPtr.h"
#include "SinkRelease.h"
#include "SyncObject.h"

#include <ocidl.h>
#include <olectl.h>

class CSinkSlot : public IConnectionPoint {
public:
    // container: the container's IUnknown, which outlives the slot.
    CSinkSlot(const IID &iid, DWORD cookie, IUnknown *container) : m_iid(iid), m_cookie(cookie), m_container(container)
    {
    }
    CSinkSlot(const CSinkSlot &) = delete;
    CSinkSlot &operator=(const CSinkSlot &) = delete;

    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return m_container->AddRef(); }
    STDMETHODIMP_(ULONG) Release() override { return m_container->Release(); }

    STDMETHODIMP GetConnectionInterface(IID *pIID) override;
    STDMETHODIMP GetConnectionPointContainer(IConnectionPointContainer **ppCPC) override;
    // CONNECT_E_ADVISELIMIT when the slot is taken; E_FAIL once closed.
    STDMETHODIMP Advise(IUnknown *pUnkSink, DWORD *pdwCookie) override;
    // CONNECT_E_NOCONNECTION for any other cookie.
    STDMETHODIMP Unadvise(DWORD dwCookie) override;
    STDMETHODIMP EnumConnections(IEnumConnections **ppEnum) override;

    // The container's IConnectionPointContainer, for a container with this
    // one point.
    HRESULT Find(REFIID riid, IConnectionPoint **ppCP);
    HRESULT Enumerate(IEnumConnectionPoints **ppEnum);

    // The sink as its interface (the slot holds it queried for the sink
    // interface), with a reference of the caller's own: a concurrent
    // Unadvise cannot free it.
    template <class I> CSinkRef<I> Sink() { return SlotSink().As<I>(); }
    bool IsFilled();
    // Releases the sink, after the slot's lock.
    void Clear();
    // The container is going: Advise fails from now on.
    void Close();

private:
    CSinkRef<IUnknown> SlotSink();

    const IID &m_iid;
    const DWORD m_cookie;
    IUnknown *const m_container;
    CCriticalSection m_lock{LockOrder::Inner}; // guards the two below
    CSinkRef<IUnknown> m_sink;
    bool m_closed = false;
};
