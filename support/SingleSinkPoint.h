#pragma once
// A connection point with room for one sink, for containers that keep the
// sink themselves (the group's IOPCDataCallback, the server's IOPCShutdown).
// Made on request; it keeps its container alive.
#include "ComObject.h"
#include "ComPtr.h"
#include "SyncObject.h"

#include <ocidl.h>
#include <olectl.h>

class ISinkSlot {
public:
    virtual const IID &SinkIid() const = 0;
    // Stores sink (already queried for SinkIid); CONNECT_E_ADVISELIMIT when
    // the slot is taken.
    virtual HRESULT FillSlot(const ComPtr<IUnknown> &sink, DWORD *cookie) = 0;
    // CONNECT_E_NOCONNECTION for any other cookie.
    virtual HRESULT EmptySlot(DWORD cookie) = 0;
    // The sink and its cookie, or null.
    virtual ComPtr<IUnknown> SlotSink(DWORD *cookie) = 0;

protected:
    ~ISinkSlot() = default;
};

// The slot itself: the sink, its fixed cookie, and a lock of its own
// (innermost) under which Advise and Unadvise change it.
class CSinkSlot : public ISinkSlot {
public:
    CSinkSlot(const IID &iid, DWORD cookie) : m_iid(iid), m_cookie(cookie) {}
    const IID &SinkIid() const override { return m_iid; }
    HRESULT FillSlot(const ComPtr<IUnknown> &sink, DWORD *cookie) override;
    HRESULT EmptySlot(DWORD cookie) override;
    ComPtr<IUnknown> SlotSink(DWORD *cookie) override;

    // The sink as its interface (the slot holds it queried for SinkIid), with
    // a reference of the caller's own: a concurrent Unadvise cannot free it.
    template <class I> ComPtr<I> Sink()
    {
        DWORD cookie;
        ComPtr<IUnknown> sink = SlotSink(&cookie);
        return ComPtr<I>(static_cast<I *>(sink.Get()));
    }
    bool IsFilled();
    // Releases the sink, after the slot's lock.
    void Clear();

private:
    const IID &m_iid;
    const DWORD m_cookie;
    CCriticalSection m_lock;
    ComPtr<IUnknown> m_sink;
};

class CSingleSinkPoint : public CComObjectRoot, public IConnectionPoint {
public:
    // container: the object's IUnknown (kept alive; answers the container query).
    static HRESULT Create(ISinkSlot *slot, IUnknown *container, REFIID riid, void **ppv);

    DECLARE_COM_UNKNOWN()

    STDMETHODIMP GetConnectionInterface(IID *pIID) override;
    STDMETHODIMP GetConnectionPointContainer(IConnectionPointContainer **ppCPC) override;
    STDMETHODIMP Advise(IUnknown *pUnkSink, DWORD *pdwCookie) override;
    STDMETHODIMP Unadvise(DWORD dwCookie) override;
    STDMETHODIMP EnumConnections(IEnumConnections **ppEnum) override;

protected:
    void *FindInterface(REFIID riid) override;

private:
    template <class T, class... Args> friend T *NewComObject(Args &&...args);
    CSingleSinkPoint() = default;

    ISinkSlot *m_slot = nullptr;
    ComPtr<IUnknown> m_container;
};

// IConnectionPointContainer::FindConnectionPoint and EnumConnectionPoints
// for a container with one such point.
HRESULT FindSingleSinkPoint(ISinkSlot *slot, IUnknown *container, REFIID riid, IConnectionPoint **ppCP);
HRESULT EnumSingleSinkPoint(ISinkSlot *slot, IUnknown *container, IEnumConnectionPoints **ppEnum);
