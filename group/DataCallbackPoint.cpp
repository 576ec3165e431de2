#include "DataCallbackPoint.h"

#include "ComEnum2.h"
#include "OPCGroup.h"

HRESULT CDataCallbackPoint::Create(COPCGroup *group, REFIID riid, void **ppv)
{
    auto *point = NewComObject<CDataCallbackPoint>();
    if (!point)
        return E_OUTOFMEMORY;
    point->m_group = group;
    point->m_keep = ComPtr<IUnknown>(group->InnerUnknown());
    return CreateComObject(point, riid, ppv);
}

void *CDataCallbackPoint::FindInterface(REFIID riid)
{
    return IsEqualIID(riid, IID_IConnectionPoint) ? static_cast<IConnectionPoint *>(this) : nullptr;
}

STDMETHODIMP CDataCallbackPoint::GetConnectionInterface(IID *pIID)
{
    if (!pIID)
        return E_POINTER;
    *pIID = IID_IOPCDataCallback;
    return S_OK;
}

STDMETHODIMP CDataCallbackPoint::GetConnectionPointContainer(IConnectionPointContainer **ppCPC)
{
    if (!ppCPC)
        return E_POINTER;
    return m_group->QueryInterface(IID_IConnectionPointContainer, reinterpret_cast<void **>(ppCPC));
}

STDMETHODIMP CDataCallbackPoint::Advise(IUnknown *pUnkSink, DWORD *pdwCookie)
{
    if (!pUnkSink || !pdwCookie)
        return E_POINTER;
    *pdwCookie = 0;
    ComPtr<IOPCDataCallback> sink;
    HRESULT hr = pUnkSink->QueryInterface(IID_IOPCDataCallback, reinterpret_cast<void **>(sink.Out()));
    if (hr == E_NOINTERFACE)
        return CONNECT_E_CANNOTCONNECT;
    if (FAILED(hr))
        return hr;
    return m_group->AdviseCallback(sink, pdwCookie);
}

STDMETHODIMP CDataCallbackPoint::Unadvise(DWORD dwCookie)
{
    return m_group->UnadviseCallback(dwCookie);
}

STDMETHODIMP CDataCallbackPoint::EnumConnections(IEnumConnections **ppEnum)
{
    if (!ppEnum)
        return E_POINTER;
    *ppEnum = nullptr;
    std::vector<CONNECTDATA> connections;
    ComPtr<IOPCDataCallback> sink = m_group->CallbackSink();
    if (sink)
        connections.push_back({sink.Detach(), COPCGroup::kCallbackCookie});
    return CEnumConnections::Create(std::move(connections), true, IID_IEnumConnections,
                                    reinterpret_cast<void **>(ppEnum));
}
