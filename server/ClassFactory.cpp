#include "ClassFactory.h"

#include "ComPtr.h"
#include "OPCServer.h"

namespace {
HRESULT CreateServer(IUnknown *outer, REFIID riid, void **ppv)
{
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
}
} // namespace

CServerClassFactory::CServerClassFactory() : CLocalClassFactory(&CreateServer) {}
