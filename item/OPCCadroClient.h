#pragma once
// The bridge from the Cadro network's real-time data to the items: one per
// process while any server object exists. It subscribes every item and
// receives the network's callbacks for them.
#include "BridgeObject.h"
#include "CadroNetwork.h"
#include "ComPtr.h"
#include "SyncObject.h"

class COPCItem;

class OPCCadroClient : public CBridgeObject, public ICadroRealTimeReceiver {
public:
    static OPCCadroClient *Create();

    // Opens the network's real-time session; on failure prints "Failed to
    // get a CadroRealTime interface" and stays, without a session.
    HRESULT Init();
    // Free: releases the real-time and session interfaces.
    void Shutdown();

    // Subscribes url ("\\.\" expands to this machine) with item as cookie.
    HRESULT Subscribe(const wchar_t *url, COPCItem *item, CadroDataItem **out);

    // ICadroRealTimeReceiver
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return BridgeAddRef(); }
    STDMETHODIMP_(ULONG) Release() override { return BridgeRelease(); }
    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                     uint32_t timeLow, uint32_t timeHigh) override;
    HRESULT STDMETHODCALLTYPE OnAttributes(void *cookie, const CadroAttributes *attributes) override;
    HRESULT STDMETHODCALLTYPE StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t) override;

private:
    OPCCadroClient() = default;

    // The session interface for one call, or null once shut down.
    ComPtr<CadroRealTime> AcquireRealTime();

    CCriticalSection m_lock;           // guards the two below
    CadroSession *m_session = nullptr; // never obtained; released if set
    CadroRealTime *m_realTime = nullptr;
};

// Expands a leading "\\.\" into "\\<host>\" (and, with bareDot, "\\." alone
// into "\\<host>"); other identifiers are unchanged. Storage of the expansion
// comes from cdd_malloc (freed by the caller with cdd_free); null when
// nothing is expanded.
wchar_t *ExpandLocalMachine(const wchar_t *url, bool bareDot = false);
