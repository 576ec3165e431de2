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
    // Lists the children of url ("\\." and "\\.\..." name this machine);
    // E_FAIL without a browse session.
    HRESULT Open(const wchar_t *url);
    HRESULT Next(uint32_t fieldMask, BrowseRecord *record);
    // Another browse session of the network, for reads beside this one's (a
    // lookup reads several branches at once); its notices come here. Null
    // when none can be had; the caller releases it.
    CadroBrowser *NewSession();
    // Open on a session of this process's: "\\." names this machine.
    static HRESULT OpenOn(CadroBrowser *browser, const wchar_t *url);

    // The process's browser receiver while the services run; the caller
    // releases the reference it gets.
    static void SetCurrent(OPCCadroBrowser *browser);
    static OPCCadroBrowser *AcquireCurrent();

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
