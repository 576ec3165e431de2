#include "ComObject.h"

#include "ComModule.h"

CComObjectRoot::CComObjectRoot(IUnknown *outer) : m_outer(outer)
{
    m_inner.owner = this;
    ComModule::Lock();
}

CComObjectRoot::~CComObjectRoot()
{
    ComModule::Unlock();
}

HRESULT CComObjectRoot::InnerQueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    *ppv = nullptr;
    if (IsEqualIID(riid, IID_IUnknown)) {
        *ppv = &m_inner;
        InnerAddRef();
        return S_OK;
    }
    void *found = FindInterface(riid);
    if (!found)
        return CreateOnQuery(riid, ppv);
    static_cast<IUnknown *>(found)->AddRef();
    *ppv = found;
    return S_OK;
}

ULONG CComObjectRoot::InnerAddRef()
{
    return static_cast<ULONG>(InterlockedIncrement(&m_refs));
}

ULONG CComObjectRoot::InnerRelease()
{
    LONG refs = InterlockedDecrement(&m_refs);
    if (refs == 0) {
        // Guard against re-entry from references taken and dropped while the
        // object tears itself down.
        m_refs = 1;
        FinalRelease();
        delete this;
    }
    return static_cast<ULONG>(refs);
}

HRESULT CComObjectRoot::OuterQueryInterface(REFIID riid, void **ppv)
{
    return m_outer ? m_outer->QueryInterface(riid, ppv) : InnerQueryInterface(riid, ppv);
}

ULONG CComObjectRoot::OuterAddRef()
{
    return m_outer ? m_outer->AddRef() : InnerAddRef();
}

ULONG CComObjectRoot::OuterRelease()
{
    return m_outer ? m_outer->Release() : InnerRelease();
}
