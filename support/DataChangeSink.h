#pragma once
// A data callback for programs that only watch data changes: OnDataChange is
// the derived class's; the completions of asynchronous calls, which such a
// program does not make, are taken and ignored.
#include "ComObject.h"
#include "opcda.h"

class CDataChangeSink : public CComObjectRoot, public IOPCDataCallback {
public:
    DECLARE_COM_UNKNOWN()
    STDMETHODIMP OnReadComplete(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD, OPCHANDLE *, VARIANT *, WORD *, FILETIME *,
                                HRESULT *) override
    {
        return S_OK;
    }
    STDMETHODIMP OnWriteComplete(DWORD, OPCHANDLE, HRESULT, DWORD, OPCHANDLE *, HRESULT *) override { return S_OK; }
    STDMETHODIMP OnCancelComplete(DWORD, OPCHANDLE) override { return S_OK; }

private:
    void *FindInterface(REFIID riid) override
    {
        return IsEqualIID(riid, IID_IOPCDataCallback) ? static_cast<IOPCDataCallback *>(this) : nullptr;
    }
};
