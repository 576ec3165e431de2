#include "ClassFactory.h"

#include "ComModule.h"
#include "ComPtr.h"
#include "ComUtil.h"
#include "OPCServer.h"

STDMETHODIMP CServerClassFactory::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IClassFactory)) {
        *ppv = static_cast<IClassFactory *>(this);
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

STDMETHODIMP CServerClassFactory::CreateInstance(IUnknown *outer, REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    *ppv = nullptr;
    if (outer && !IsEqualIID(riid, IID_IUnknown))
        return CLASS_E_NOAGGREGATION;
    return ComBoundary([&]() -> HRESULT {
        COPCServer *server = COPCServer::Create(outer);
        if (!server)
            return E_OUTOFMEMORY;
        // The holder's release destroys the object when construction or the
        // query fails: final release, lock count, destructor.
        ComPtr<IUnknown> holder(server->InnerUnknown());
        HRESULT hr = server->FinalConstruct();
        if (SUCCEEDED(hr))
            hr = holder->QueryInterface(riid, ppv);
        return hr;
    });
}

STDMETHODIMP CServerClassFactory::LockServer(BOOL lock)
{
    if (lock)
        ComModule::Lock();
    else
        ComModule::Unlock();
    return S_OK;
}
