#pragma once
// The server browser object: the classes of component categories on this
// machine (the OPC servers, for the OPC categories), their names, and the
// class of a ProgID, for clients on this or another machine.
#include "ComObject.h"
#include "opccomn.h"

class COPCServerList : public CComObjectRoot, public IOPCServerList, public IOPCServerList2 {
public:
    // The class object's creator (LocalClassFactory.h).
    static HRESULT Create(IUnknown *outer, REFIID riid, void **ppv);

    DECLARE_COM_UNKNOWN()

    // IOPCServerList
    STDMETHODIMP EnumClassesOfCategories(ULONG cImplemented, CATID rgcatidImpl[], ULONG cRequired, CATID rgcatidReq[],
                                         IEnumGUID **ppenumClsid) override;
    STDMETHODIMP GetClassDetails(REFCLSID clsid, LPOLESTR *ppszProgID, LPOLESTR *ppszUserType) override;
    // IOPCServerList and IOPCServerList2
    STDMETHODIMP CLSIDFromProgID(LPCOLESTR szProgId, LPCLSID clsid) override;

    // IOPCServerList2
    STDMETHODIMP EnumClassesOfCategories(ULONG cImplemented, CATID rgcatidImpl[], ULONG cRequired, CATID rgcatidReq[],
                                         IOPCEnumGUID **ppenumClsid) override;
    STDMETHODIMP GetClassDetails(REFCLSID clsid, LPOLESTR *ppszProgID, LPOLESTR *ppszUserType,
                                 LPOLESTR *ppszVerIndProgID) override;

protected:
    void *FindInterface(REFIID riid) override;

private:
    explicit COPCServerList(IUnknown *outer) : CComObjectRoot(outer) {}
    template <class T, class... Args> friend T *NewComObject(Args &&...args);

    template <class Enumerator> HRESULT Enumerate(ULONG cImplemented, const CATID *implemented, ULONG cRequired,
                                                  const CATID *required, REFIID riid, void **ppenum);
    HRESULT Details(REFCLSID clsid, LPOLESTR *progId, LPOLESTR *userType, LPOLESTR *versionIndependent);
};
