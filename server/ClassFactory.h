#pragma once
// The class object of the server class. Registered for the whole server run;
// it is not counted in the module lock count.
#include <unknwn.h>

#include <atomic>

class CServerClassFactory : public IClassFactory {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }

    STDMETHODIMP CreateInstance(IUnknown *outer, REFIID riid, void **ppv) override;
    STDMETHODIMP LockServer(BOOL lock) override;

private:
    std::atomic<LONG> m_serverLocks{0}; // outstanding LockServer(TRUE)
};
