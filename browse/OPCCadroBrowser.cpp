#include "OPCCadroBrowser.h"

#include "OPCCadroClient.h"
#include "SyncObject.h"
#include "Trace.h"

#include <cstdio>
#include <cwchar>
#include <new>
#include <string>

namespace {
CCriticalSection g_currentLock;
OPCCadroBrowser *g_current = nullptr;
} // namespace

void OPCCadroBrowser::SetCurrent(OPCCadroBrowser *browser)
{
    CSingleLock lock(&g_currentLock);
    if (browser)
        browser->AddRef();
    if (g_current)
        g_current->Release();
    g_current = browser;
}

OPCCadroBrowser *OPCCadroBrowser::AcquireCurrent()
{
    CSingleLock lock(&g_currentLock);
    if (g_current)
        g_current->AddRef();
    return g_current;
}

HRESULT OPCCadroBrowser::Open(const wchar_t *url)
{
    return OpenOn(m_browser, url);
}

HRESULT OPCCadroBrowser::OpenOn(CadroBrowser *browser, const wchar_t *url)
{
    // No session (the factory failed): nothing can be browsed.
    if (!browser || !url)
        return E_FAIL;
    wchar_t *expanded = ExpandLocalMachine(url, true);
    HRESULT hr = browser->Open(expanded ? expanded : url);
    cdd_free(expanded);
    return hr;
}

CadroBrowser *OPCCadroBrowser::NewSession()
{
    CadroBrowser *session = nullptr;
    return m_browser && NewCadroBrowser(0, this, &session) ? session : nullptr;
}

HRESULT OPCCadroBrowser::Next(uint32_t fieldMask, BrowseRecord *record)
{
    return m_browser ? m_browser->Next(fieldMask, record) : E_FAIL;
}

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
