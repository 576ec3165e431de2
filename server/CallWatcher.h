#pragma once
// Tells the server's lifetime of every call that reaches the process, before
// the call is served. A client that fetched the class object from the
// registry just before the process revoked it reaches the process with its
// first call (the registry's object, then IClassFactory): the lifetime
// registers the class object again in time for that call to find it.
#include <objidl.h>

class CServerLifetime;

class CCallWatcher : public IChannelHook {
public:
    explicit CCallWatcher(CServerLifetime &lifetime) : m_lifetime(lifetime) {}
    // Registers the hook for the process (it stays for the process's life).
    HRESULT Install();

    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return 2; } // lives as long as the process
    STDMETHODIMP_(ULONG) Release() override { return 1; }

    // Nothing is added to the calls: every size is 0.
    void STDMETHODCALLTYPE ClientGetSize(REFGUID, REFIID, ULONG *pDataSize) override;
    void STDMETHODCALLTYPE ClientFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *) override;
    void STDMETHODCALLTYPE ClientNotify(REFGUID, REFIID, ULONG, void *, DWORD, HRESULT) override {}
    void STDMETHODCALLTYPE ServerNotify(REFGUID, REFIID, ULONG, void *, DWORD) override;
    void STDMETHODCALLTYPE ServerGetSize(REFGUID, REFIID, HRESULT, ULONG *pDataSize) override;
    void STDMETHODCALLTYPE ServerFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *, HRESULT) override;

private:
    CServerLifetime &m_lifetime;
};
