#pragma once
// The group's one connection point, for IOPCDataCallback. A small object
// made on request that keeps its group alive; the sink itself lives in the
// group.
#include "ComObject.h"
#include "ComPtr.h"

#include <ocidl.h>
#include <olectl.h>

class COPCGroup;

class CDataCallbackPoint : public CComObjectRoot, public IConnectionPoint {
public:
    static HRESULT Create(COPCGroup *group, REFIID riid, void **ppv);

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
    CDataCallbackPoint() = default;

    COPCGroup *m_group = nullptr;
    ComPtr<IUnknown> m_keep; // the group
};
