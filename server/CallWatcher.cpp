#include "CallWatcher.h"

#include "ServerLifetime.h"

namespace {
// The extension's identifier: its own, never sent (its data is always empty).
const GUID kCallWatcherExtension = {0x6d2c4a31, 0x8e0f, 0x4b7a, {0x9c, 0x55, 0x1e, 0x3f, 0x72, 0x4d, 0x0a, 0x61}};
} // namespace

HRESULT CCallWatcher::Install()
{
    return CoRegisterChannelHook(kCallWatcherExtension, this);
}

STDMETHODIMP CCallWatcher::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IChannelHook)) {
        *ppv = static_cast<IChannelHook *>(this);
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

void STDMETHODCALLTYPE CCallWatcher::ClientGetSize(REFGUID, REFIID, ULONG *pDataSize)
{
    if (pDataSize)
        *pDataSize = 0;
}

void STDMETHODCALLTYPE CCallWatcher::ClientFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *)
{
    if (pDataSize)
        *pDataSize = 0;
}

void STDMETHODCALLTYPE CCallWatcher::ServerNotify(REFGUID, REFIID, ULONG, void *, DWORD)
{
    m_lifetime.IncomingCall();
}

void STDMETHODCALLTYPE CCallWatcher::ServerGetSize(REFGUID, REFIID, HRESULT, ULONG *pDataSize)
{
    if (pDataSize)
        *pDataSize = 0;
}

void STDMETHODCALLTYPE CCallWatcher::ServerFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *, HRESULT)
{
    if (pDataSize)
        *pDataSize = 0;
}
