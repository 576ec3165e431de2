#include "ClassFactory.h"

#include "ComPtr.h"
#include "OPCServer.h"

#include <ocidl.h>

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

const ExportedInterfaces &ServerInterfaces()
{
    static const ExportedInterfaces interfaces = {&IID_IOPCServer,
                                                  &IID_IOPCCommon,
                                                  &IID_IOPCItemProperties,
                                                  &IID_IOPCBrowseServerAddressSpace,
                                                  &IID_IConnectionPointContainer,
                                                  &IID_IConnectionPoint,
                                                  &IID_IEnumConnectionPoints,
                                                  &IID_IEnumConnections,
                                                  &IID_IOPCGroupStateMgt,
                                                  &IID_IOPCItemMgt,
                                                  &IID_IOPCSyncIO,
                                                  &IID_IOPCAsyncIO,
                                                  &IID_IOPCAsyncIO2,
                                                  &IID_IDataObject,
                                                  &IID_IEnumOPCItemAttributes,
                                                  &IID_IEnumString,
                                                  &IID_IEnumUnknown};
    return interfaces;
}
