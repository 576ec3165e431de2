#pragma once
// Marks the calls of this process's registry probe (ServerLifetime.h) and
// recognises them where they arrive, in this process or in another copy of
// the server. A probe's lookup of the class object must not count as a
// client: it takes the registry's last answer only to make sure that nobody
// else holds it. The platform passes a hook's data only with calls that carry
// some, which is why a probe marks its calls rather than clients theirs.
#include <objidl.h>

class CCallWatcher : public IChannelHook {
public:
    // Registers the hook for the process (it stays for the process's life).
    HRESULT Install();

    // While it lives, the calls this thread makes carry the probe's mark.
    class ProbeScope {
    public:
        ProbeScope();
        ~ProbeScope();
        ProbeScope(const ProbeScope &) = delete;
        ProbeScope &operator=(const ProbeScope &) = delete;
    };
    // Whether the call this thread is serving came from a probe; asked once
    // per call.
    static bool TakeIncomingProbe();

    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return 2; } // lives as long as the process
    STDMETHODIMP_(ULONG) Release() override { return 1; }

    void STDMETHODCALLTYPE ClientGetSize(REFGUID, REFIID, ULONG *pDataSize) override;
    void STDMETHODCALLTYPE ClientFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *pDataBuffer) override;
    void STDMETHODCALLTYPE ClientNotify(REFGUID, REFIID, ULONG, void *, DWORD, HRESULT) override {}
    void STDMETHODCALLTYPE ServerNotify(REFGUID, REFIID, ULONG cbDataSize, void *pDataBuffer, DWORD) override;
    void STDMETHODCALLTYPE ServerGetSize(REFGUID, REFIID, HRESULT, ULONG *pDataSize) override;
    void STDMETHODCALLTYPE ServerFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *, HRESULT) override;
};
