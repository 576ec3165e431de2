#pragma once
// The receiver of the Cadro network's browse notifications and holder of the
// browse session: one per process while any server object exists.
#include "BridgeObject.h"
#include "CadroNetwork.h"

class OPCCadroBrowser : public CBridgeObject, public ICadroBrowserReceiver {
public:
    static OPCCadroBrowser *Create();

    // Opens the browse session; on failure prints "Failed to get a
    // CadroBrowser interface" and stays, without a session.
    HRESULT Init();
    // Free: releases the browser and session interfaces.
    void Shutdown();
    CadroBrowser *Browser() const { return m_browser; }

    // ICadroBrowserReceiver
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return BridgeAddRef(); }
    STDMETHODIMP_(ULONG) Release() override { return BridgeRelease(); }
    HRESULT STDMETHODCALLTYPE BrowseItemChanged() override;

private:
    OPCCadroBrowser() = default;

    CadroSession *m_session = nullptr; // never obtained; released if set
    CadroBrowser *m_browser = nullptr;
};
