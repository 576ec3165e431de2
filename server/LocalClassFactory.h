#pragma once
// The class object of a local server's class. Registered for the whole run;
// it is not counted in the module lock count, but every creation and every
// LockServer(TRUE) is (ComModule.h).
#include <unknwn.h>

#include <atomic>

class CLocalClassFactory : public IClassFactory {
public:
    // Makes the object and hands out its interface riid; the object holds the
    // module lock count itself from its construction on.
    using Creator = HRESULT (*)(IUnknown *outer, REFIID riid, void **ppv);

    explicit CLocalClassFactory(Creator create) : m_create(create) {}
    CLocalClassFactory(const CLocalClassFactory &) = delete;
    CLocalClassFactory &operator=(const CLocalClassFactory &) = delete;

    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }

    STDMETHODIMP CreateInstance(IUnknown *outer, REFIID riid, void **ppv) override;
    STDMETHODIMP LockServer(BOOL lock) override;

private:
    Creator m_create;
    std::atomic<LONG> m_serverLocks{0}; // outstanding LockServer(TRUE)
};
