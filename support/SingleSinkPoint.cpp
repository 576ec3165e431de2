#include "SingleSinkPoint.h"

#include "ComEnum2.h"

STDMETHODIMP CSinkSlot::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IConnectionPoint)) {
        *ppv = static_cast<IConnectionPoint *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

STDMETHODIMP CSinkSlot::GetConnectionInterface(IID *pIID)
{
    if (!pIID)
        return E_POINTER;
    *pIID = m_iid;
    return S_OK;
}

STDMETHODIMP CSinkSlot::GetConnectionPointContainer(IConnectionPointContainer **ppCPC)
{
    if (!ppCPC)
        return E_POINTER;
    return m_container->QueryInterface(IID_IConnectionPointContainer, reinterpret_cast<void **>(ppCPC));
}

STDMETHODIMP CSinkSlot::Advise(IUnknown *pUnkSink, DWORD *pdwCookie)
{
    if (!pUnkSink || !pdwCookie)
        return E_POINTER;
    *pdwCookie = 0;
    {
        CSingleLock lock(&m_lock);
        if (m_closed)
            return E_FAIL;
    }
    IUnknown *queried = nullptr;
    HRESULT hr = pUnkSink->QueryInterface(m_iid, reinterpret_cast<void **>(&queried));
    if (hr == E_NOINTERFACE)
        return CONNECT_E_CANNOTCONNECT;
    if (FAILED(hr))
        return hr;
    // One not stored is released with the holder, after the lock.
    CSinkRef<IUnknown> sink = CSinkRef<IUnknown>::Attach(queried, SinkRelease::IsRemote(queried));
    CSingleLock lock(&m_lock);
    if (m_closed)
        return E_FAIL;
    if (m_sink)
        return CONNECT_E_ADVISELIMIT;
    m_sink = std::move(sink);
    *pdwCookie = m_cookie;
    return S_OK;
}

STDMETHODIMP CSinkSlot::Unadvise(DWORD dwCookie)
{
    CSinkRef<IUnknown> released; // released after the lock
    CSingleLock lock(&m_lock);
    if (dwCookie != m_cookie || !m_sink)
        return CONNECT_E_NOCONNECTION;
    released = std::move(m_sink);
    return S_OK;
}

STDMETHODIMP CSinkSlot::EnumConnections(IEnumConnections **ppEnum)
{
    if (!ppEnum)
        return E_POINTER;
    *ppEnum = nullptr;
    std::vector<CONNECTDATA> connections;
    CSinkRef<IUnknown> sink = SlotSink();
    if (sink)
        connections.push_back({sink.Detach(), m_cookie});
    return CEnumConnections::Create(std::move(connections), true, IID_IEnumConnections,
                                    reinterpret_cast<void **>(ppEnum));
}

HRESULT CSinkSlot::Find(REFIID riid, IConnectionPoint **ppCP)
{
    if (!ppCP)
        return E_POINTER;
    *ppCP = nullptr;
    if (!IsEqualIID(riid, m_iid))
        return CONNECT_E_NOCONNECTION;
    AddRef();
    *ppCP = this;
    return S_OK;
}

HRESULT CSinkSlot::Enumerate(IEnumConnectionPoints **ppEnum)
{
    if (!ppEnum)
        return E_POINTER;
    *ppEnum = nullptr;
    AddRef(); // the enumerator's, released with it
    return CEnumConnectionPoints::Create({this}, true, IID_IEnumConnectionPoints, reinterpret_cast<void **>(ppEnum));
}

CSinkRef<IUnknown> CSinkSlot::SlotSink()
{
    CSingleLock lock(&m_lock);
    return m_sink;
}

bool CSinkSlot::IsFilled()
{
    CSingleLock lock(&m_lock);
    return m_sink.Get() != nullptr;
}

void CSinkSlot::Clear()
{
    CSinkRef<IUnknown> released;
    CSingleLock lock(&m_lock);
    released = std::move(m_sink);
}

void CSinkSlot::Close()
{
    CSingleLock lock(&m_lock);
    m_closed = true;
}
