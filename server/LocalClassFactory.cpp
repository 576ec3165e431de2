#include "LocalClassFactory.h"

#include "ComModule.h"
#include "ComUtil.h"

STDMETHODIMP CLocalClassFactory::QueryInterface(REFIID riid, void **ppv)
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

STDMETHODIMP CLocalClassFactory::CreateInstance(IUnknown *outer, REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    *ppv = nullptr;
    if (outer && !IsEqualIID(riid, IID_IUnknown))
        return CLASS_E_NOAGGREGATION;
    // The creation holds the process until the object holds it itself; once
    // the process has decided to exit it refuses, and COM's activation
    // starts another process.
    if (!ComModule::TryLock())
        return CO_E_SERVER_STOPPING;
    struct CreationHold {
        ~CreationHold() { ComModule::Unlock(); }
    } hold;
    return ComBoundary([&]() -> HRESULT { return m_create(outer, riid, ppv); });
}

STDMETHODIMP CLocalClassFactory::LockServer(BOOL lock)
{
    if (lock) {
        if (!ComModule::TryLock())
            return CO_E_SERVER_STOPPING;
        ++m_serverLocks;
        return S_OK;
    }
    // An unlock without a lock of its own would end the process under other
    // clients' objects: it is ignored.
    LONG locks = m_serverLocks.load();
    while (locks > 0 && !m_serverLocks.compare_exchange_weak(locks, locks - 1)) {
    }
    if (locks > 0)
        ComModule::Unlock();
    return S_OK;
}
