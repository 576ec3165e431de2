#include "OPCCadroClient.h"

#include "OPCItem.h"
#include "Trace.h"

#include <cstdio>
#include <cwchar>
#include <new>
#include <utility>

OPCCadroClient *OPCCadroClient::Create()
{
    return new (std::nothrow) OPCCadroClient();
}

HRESULT OPCCadroClient::Init()
{
    Trace("Initializing OPCCadroClient\n");
    if (!NewCadroRealTime(0, this, &m_realTime)) {
        printf("Failed to get a CadroRealTime interface\n");
        fflush(stdout);
        Shutdown();
        return E_FAIL;
    }
    return S_OK;
}

void OPCCadroClient::Shutdown()
{
    Trace("Freeing OPCCadroClient\n");
    CadroRealTime *realTime;
    CadroSession *session;
    {
        CSingleLock lock(&m_lock);
        realTime = std::exchange(m_realTime, nullptr);
        session = std::exchange(m_session, nullptr);
    }
    // Released after the lock: a subscription in progress holds its own
    // reference to the session.
    if (realTime) {
        Trace("Releasing the CadroRealTime interface\n");
        realTime->Release();
    }
    if (session) {
        Trace("Releasing the CadroSession interface\n");
        session->Release();
    }
}

ComPtr<CadroRealTime> OPCCadroClient::AcquireRealTime()
{
    CSingleLock lock(&m_lock);
    return ComPtr<CadroRealTime>(m_realTime);
}

wchar_t *ExpandLocalMachine(const wchar_t *url, bool bareDot)
{
    if (wcsncmp(url, L"\\\\.\\", 4) != 0 && !(bareDot && wcscmp(url, L"\\\\.") == 0))
        return nullptr;
    BSTR host = nullptr;
    GetHostMachineName(&host);
    size_t hostLength = host ? SysStringLen(host) : 0;
    size_t rest = wcslen(url + 3); // from the backslash after the dot
    auto *expanded = static_cast<wchar_t *>(cdd_malloc((2 + hostLength + rest + 1) * sizeof(wchar_t)));
    if (expanded) {
        wcscpy(expanded, L"\\\\");
        if (host)
            wcscat(expanded, host);
        wcscat(expanded, url + 3);
    }
    SysFreeString(host);
    return expanded;
}

HRESULT OPCCadroClient::Subscribe(const wchar_t *url, COPCItem *item, CadroDataItem **out)
{
    *out = nullptr;
    // No session (the factory failed, or the services shut down): the
    // network cannot know the item.
    ComPtr<CadroRealTime> realTime = AcquireRealTime();
    if (!realTime)
        return E_FAIL;
    SubscribeOptions options = {13, 7, 0, 0, 0};
    wchar_t *expanded = ExpandLocalMachine(url);
    HRESULT hr = realTime->Subscribe(expanded ? expanded : url, item, &options, out);
    cdd_free(expanded);
    return hr;
}

STDMETHODIMP OPCCadroClient::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, __uuidof(ICadroRealTimeReceiver))) {
        *ppv = static_cast<ICadroRealTimeReceiver *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

HRESULT STDMETHODCALLTYPE OPCCadroClient::OnData(void *cookie, uint32_t flags, const CadroValue *value,
                                                 int32_t errorFlag, uint32_t timeLow, uint32_t timeHigh)
{
    if (cookie && value)
        static_cast<COPCItem *>(cookie)->OnDataUpdate(flags, *value, errorFlag, FILETIME{timeLow, timeHigh});
    return S_OK;
}

HRESULT STDMETHODCALLTYPE OPCCadroClient::OnAttributes(void *cookie, const CadroAttributes *attributes)
{
    if (cookie && attributes)
        static_cast<COPCItem *>(cookie)->OnAttributesUpdate(*attributes);
    return S_OK;
}

HRESULT STDMETHODCALLTYPE OPCCadroClient::StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t)
{
    static const char *const texts[] = {"Cadro: Connecting to the server....\n",
                                        "Cadro: The server has been contacted.\n",
                                        "Cadro: The connection was disconnected by the server!\n",
                                        "Cadro: Subscribing to the data item on the server.\n",
                                        "Cadro: The subscription was successful.\n",
                                        "Cadro: The subscription failed!\n"};
    Trace("StatusChange\n");
    if (status >= 13 && status <= 18)
        Trace("%s", texts[status - 13]);
    if (cookie)
        static_cast<COPCItem *>(cookie)->OnStatusUpdate(status);
    return S_OK;
}
