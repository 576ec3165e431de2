#include "TestSink.h"

#include <cmath>

namespace {
Callback Make(Callback::Kind kind, DWORD transid, OPCHANDLE group, HRESULT quality, HRESULT error)
{
    Callback c;
    c.kind = kind;
    c.transid = transid;
    c.group = group;
    c.masterQuality = quality;
    c.masterError = error;
    return c;
}
} // namespace

STDMETHODIMP TestSink::QueryInterface(REFIID riid, void **ppv)
{
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCDataCallback)) {
        *ppv = static_cast<IOPCDataCallback *>(this);
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

HRESULT TestSink::Record(Callback c, DWORD count, VARIANT *values, WORD *qualities, HRESULT *errors)
{
    c.thread = GetCurrentThreadId();
    for (DWORD i = 0; values && i < count; ++i)
        c.values.push_back(V_VT(&values[i]) == VT_R8 ? V_R8(&values[i]) : std::nan(""));
    if (qualities)
        c.qualities.assign(qualities, qualities + count);
    if (errors)
        c.errors.assign(errors, errors + count);
    std::lock_guard<std::mutex> l(m_lock);
    m_calls.push_back(std::move(c));
    m_changed.notify_all();
    return S_OK;
}

STDMETHODIMP TestSink::OnDataChange(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMasterquality, HRESULT hrMastererror,
                                    DWORD dwCount, OPCHANDLE *phClientItems, VARIANT *pvValues, WORD *pwQualities,
                                    FILETIME *, HRESULT *pErrors)
{
    Callback c = Make(Callback::DataChange, dwTransid, hGroup, hrMasterquality, hrMastererror);
    c.clients.assign(phClientItems, phClientItems + dwCount);
    Record(std::move(c), dwCount, pvValues, pwQualities, pErrors);
    if (onDataChange)
        onDataChange();
    return dataChangeResult;
}

STDMETHODIMP TestSink::OnReadComplete(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMasterquality, HRESULT hrMastererror,
                                      DWORD dwCount, OPCHANDLE *phClientItems, VARIANT *pvValues, WORD *pwQualities,
                                      FILETIME *, HRESULT *pErrors)
{
    Callback c = Make(Callback::ReadComplete, dwTransid, hGroup, hrMasterquality, hrMastererror);
    c.clients.assign(phClientItems, phClientItems + dwCount);
    HRESULT hr = Record(std::move(c), dwCount, pvValues, pwQualities, pErrors);
    if (onReadComplete)
        onReadComplete(dwTransid);
    return hr;
}

STDMETHODIMP TestSink::OnWriteComplete(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMastererr, DWORD dwCount,
                                       OPCHANDLE *pClienthandles, HRESULT *pErrors)
{
    Callback c = Make(Callback::WriteComplete, dwTransid, hGroup, S_OK, hrMastererr);
    c.clients.assign(pClienthandles, pClienthandles + dwCount);
    return Record(std::move(c), dwCount, nullptr, nullptr, pErrors);
}

STDMETHODIMP TestSink::OnCancelComplete(DWORD dwTransid, OPCHANDLE hGroup)
{
    return Record(Make(Callback::CancelComplete, dwTransid, hGroup, S_OK, S_OK), 0, nullptr, nullptr, nullptr);
}

std::vector<Callback> TestSink::Snapshot()
{
    std::lock_guard<std::mutex> l(m_lock);
    return m_calls;
}

size_t TestSink::Count(Callback::Kind kind)
{
    std::lock_guard<std::mutex> l(m_lock);
    size_t n = 0;
    for (const auto &c : m_calls)
        n += c.kind == kind;
    return n;
}

bool TestSink::WaitFor(const std::function<bool(const std::vector<Callback> &)> &pred, int timeoutMs)
{
    std::unique_lock<std::mutex> l(m_lock);
    return m_changed.wait_for(l, std::chrono::milliseconds(timeoutMs), [&] { return pred(m_calls); });
}
