#pragma once
// The server's class object as the platform's registry of running class
// objects holds it: registered for every client or for one, switched between
// the two without a moment in which a lookup in this process finds nothing,
// and the probe that asks the registry for it as a client would
// (ServerLifetime.h says why).
#include "ServerLifetime.h"

#include <unknwn.h>

#include <atomic>

class CClassObjectRegistration final : public CClassRegistration, public IUnknown {
public:
    CClassObjectRegistration(REFCLSID clsid, IClassFactory &factory) : m_clsid(clsid), m_factory(factory) {}
    CClassObjectRegistration(const CClassObjectRegistration &) = delete;
    CClassObjectRegistration &operator=(const CClassObjectRegistration &) = delete;
    // Lookups and probes report to lifetime from now on.
    void Attach(CServerLifetime &lifetime) { m_lifetime = &lifetime; }

    HRESULT Register(Use use) override;
    HRESULT Switch(Use use) override;
    void Revoke() override;
    void Probe() override;

    // The object the registry holds: a lookup that the lifetime lets through
    // gets the factory.
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return 2; } // lives as long as the process
    STDMETHODIMP_(ULONG) Release() override;

private:
    static DWORD WINAPI ProbeThread(void *self);

    CLSID m_clsid;
    IClassFactory &m_factory;
    CServerLifetime *m_lifetime = nullptr;
    DWORD m_cookie = 0;
    // A switch in progress: the thread whose revocation releases the object,
    // and the registration that follows.
    std::atomic<DWORD> m_switchThread{0};
    Use m_switchTo = Use::Shared;
    HRESULT m_switchResult = S_OK;
};
