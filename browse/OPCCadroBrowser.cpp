#include "OPCCadroBrowser.h"

#include "Trace.h"

#include <cstdio>
#include <new>

OPCCadroBrowser *OPCCadroBrowser::Create()
{
    return new (std::nothrow) OPCCadroBrowser();
}

HRESULT OPCCadroBrowser::Init()
{
    if (!NewCadroBrowser(0, this, &m_browser)) {
        printf("Failed to get a CadroBrowser interface\n");
        fflush(stdout);
        Shutdown();
        return E_FAIL;
    }
    return S_OK;
}

void OPCCadroBrowser::Shutdown()
{
    Trace("Freeing OPCCadroBrowser\n");
    if (m_browser) {
        Trace("Releasing the CadroBrowser interface\n");
        m_browser->Release();
        m_browser = nullptr;
    }
    if (m_session) {
        Trace("Releasing the CadroSession interface\n");
        m_session->Release();
        m_session = nullptr;
    }
}

STDMETHODIMP OPCCadroBrowser::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, __uuidof(ICadroBrowserReceiver))) {
        *ppv = static_cast<ICadroBrowserReceiver *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

HRESULT STDMETHODCALLTYPE OPCCadroBrowser::BrowseItemChanged()
{
    // The tree is refreshed on every descent; the notice is only traced.
    Trace("Some browse item on the network has changed\n");
    return 0;
}
