#include "CallWatcher.h"

#include <cstring>

namespace {
// The extension's identifier and the probe's mark: the same in every copy of
// the server.
const GUID kCallWatcherExtension = {0x6d2c4a31, 0x8e0f, 0x4b7a, {0x9c, 0x55, 0x1e, 0x3f, 0x72, 0x4d, 0x0a, 0x61}};
constexpr char kProbeMark[8] = {'S', 'k', 'y', 'P', 'r', 'o', 'b', 'e'};

thread_local bool t_probing = false;       // this thread's calls are a probe's
thread_local bool t_incomingProbe = false; // the call this thread serves is a probe's
} // namespace

HRESULT CCallWatcher::Install()
{
    return CoRegisterChannelHook(kCallWatcherExtension, this);
}

CCallWatcher::ProbeScope::ProbeScope()
{
    t_probing = true;
}

CCallWatcher::ProbeScope::~ProbeScope()
{
    t_probing = false;
}

bool CCallWatcher::TakeIncomingProbe()
{
    bool probe = t_incomingProbe;
    t_incomingProbe = false;
    return probe;
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
        *pDataSize = t_probing ? sizeof(kProbeMark) : 0;
}

void STDMETHODCALLTYPE CCallWatcher::ClientFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *pDataBuffer)
{
    if (!pDataSize)
        return;
    if (!t_probing || !pDataBuffer || *pDataSize < sizeof(kProbeMark)) {
        *pDataSize = 0;
        return;
    }
    memcpy(pDataBuffer, kProbeMark, sizeof(kProbeMark));
    *pDataSize = sizeof(kProbeMark);
}

void STDMETHODCALLTYPE CCallWatcher::ServerNotify(REFGUID, REFIID, ULONG cbDataSize, void *pDataBuffer, DWORD)
{
    t_incomingProbe =
        cbDataSize == sizeof(kProbeMark) && pDataBuffer && memcmp(pDataBuffer, kProbeMark, sizeof(kProbeMark)) == 0;
}

void STDMETHODCALLTYPE CCallWatcher::ServerGetSize(REFGUID, REFIID, HRESULT, ULONG *pDataSize)
{
    // The call has been served: its mark must not pass to the thread's next
    // call, about which the platform may say nothing.
    t_incomingProbe = false;
    if (pDataSize)
        *pDataSize = 0;
}

void STDMETHODCALLTYPE CCallWatcher::ServerFillBuffer(REFGUID, REFIID, ULONG *pDataSize, void *, HRESULT)
{
    if (pDataSize)
        *pDataSize = 0;
}
