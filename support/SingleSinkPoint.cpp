#include "SingleSinkPoint.h"

#include "ComEnum2.h"

HRESULT CSinkSlot::FillSlot(const ComPtr<IUnknown> &sink, DWORD *cookie)
{
    CSingleLock lock(&m_lock);
    if (m_sink)
        return CONNECT_E_ADVISELIMIT;
    m_sink = sink;
    *cookie = m_cookie;
    return S_OK;
}

HRESULT CSinkSlot::EmptySlot(DWORD cookie)
{
    ComPtr<IUnknown> released; // released after the lock
    CSingleLock lock(&m_lock);
    if (cookie != m_cookie || !m_sink)
        return CONNECT_E_NOCONNECTION;
    released = std::move(m_sink);
    return S_OK;
}

ComPtr<IUnknown> CSinkSlot::SlotSink(DWORD *cookie)
{
    CSingleLock lock(&m_lock);
    *cookie = m_cookie;
    return m_sink;
}

bool CSinkSlot::IsFilled()
{
    CSingleLock lock(&m_lock);
    return m_sink.Get() != nullptr;
}

void CSinkSlot::Clear()
{
    ComPtr<IUnknown> released;
    CSingleLock lock(&m_lock);
    released = std::move(m_sink);
}

HRESULT CSingleSinkPoint::Create(ISinkSlot *slot, IUnknown *container, REFIID riid, void **ppv)
{
    auto *point = NewComObject<CSingleSinkPoint>();
    if (!point)
        return E_OUTOFMEMORY;
    point->m_slot = slot;
    point->m_container = ComPtr<IUnknown>(container);
    return CreateComObject(point, riid, ppv);
}

void *CSingleSinkPoint::FindInterface(REFIID riid)
{
    return IsEqualIID(riid, IID_IConnectionPoint) ? static_cast<IConnectionPoint *>(this) : nullptr;
}

STDMETHODIMP CSingleSinkPoint::GetConnectionInterface(IID *pIID)
{
    if (!pIID)
        return E_POINTER;
    *pIID = m_slot->SinkIid();
    return S_OK;
}

STDMETHODIMP CSingleSinkPoint::GetConnectionPointContainer(IConnectionPointContainer **ppCPC)
{
    if (!ppCPC)
        return E_POINTER;
    return m_container->QueryInterface(IID_IConnectionPointContainer, reinterpret_cast<void **>(ppCPC));
}

STDMETHODIMP CSingleSinkPoint::Advise(IUnknown *pUnkSink, DWORD *pdwCookie)
{
    if (!pUnkSink || !pdwCookie)
        return E_POINTER;
    *pdwCookie = 0;
    ComPtr<IUnknown> sink;
    HRESULT hr = pUnkSink->QueryInterface(m_slot->SinkIid(), reinterpret_cast<void **>(sink.Out()));
    if (hr == E_NOINTERFACE)
        return CONNECT_E_CANNOTCONNECT;
    if (FAILED(hr))
        return hr;
    hr = m_slot->FillSlot(sink, pdwCookie);
    if (FAILED(hr))
        *pdwCookie = 0;
    return hr; // a sink not stored is released with the holder, after the slot's lock
}

STDMETHODIMP CSingleSinkPoint::Unadvise(DWORD dwCookie)
{
    return m_slot->EmptySlot(dwCookie);
}

STDMETHODIMP CSingleSinkPoint::EnumConnections(IEnumConnections **ppEnum)
{
    if (!ppEnum)
        return E_POINTER;
    *ppEnum = nullptr;
    std::vector<CONNECTDATA> connections;
    DWORD cookie = 0;
    ComPtr<IUnknown> sink = m_slot->SlotSink(&cookie);
    if (sink)
        connections.push_back({sink.Detach(), cookie});
    return CEnumConnections::Create(std::move(connections), true, IID_IEnumConnections,
                                    reinterpret_cast<void **>(ppEnum));
}

HRESULT FindSingleSinkPoint(ISinkSlot *slot, IUnknown *container, REFIID riid, IConnectionPoint **ppCP)
{
    if (!ppCP)
        return E_POINTER;
    *ppCP = nullptr;
    if (!IsEqualIID(riid, slot->SinkIid()))
        return CONNECT_E_NOCONNECTION;
    return CSingleSinkPoint::Create(slot, container, IID_IConnectionPoint, reinterpret_cast<void **>(ppCP));
}

HRESULT EnumSingleSinkPoint(ISinkSlot *slot, IUnknown *container, IEnumConnectionPoints **ppEnum)
{
    if (!ppEnum)
        return E_POINTER;
    *ppEnum = nullptr;
    IConnectionPoint *point = nullptr;
    HRESULT hr = CSingleSinkPoint::Create(slot, container, IID_IConnectionPoint, reinterpret_cast<void **>(&point));
    if (FAILED(hr))
        return hr;
    return CEnumConnectionPoints::Create({point}, true, IID_IEnumConnectionPoints, reinterpret_cast<void **>(ppEnum));
}
