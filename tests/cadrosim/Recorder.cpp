#include "Recorder.h"

STDMETHODIMP Recorder::QueryInterface(REFIID riid, void **ppv)
{
    if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, __uuidof(ICadroRealTimeReceiver))) {
        *ppv = this;
        AddRef();
        return S_OK;
    }
    *ppv = nullptr;
    return E_NOINTERFACE;
}

std::wstring TextOf(const CadroValue &value)
{
    if (!(value.type & kCadroTextBit) || !value.text)
        return L"";
    if (value.type == kCadroWideText) {
        ICadroWideText *wide = nullptr;
        if (FAILED(value.text->QueryInterface(__uuidof(ICadroWideText), reinterpret_cast<void **>(&wide))))
            return L"<no wide interface>";
        std::wstring s = wide->Chars();
        wide->Release();
        return s;
    }
    ICadroNarrowText *narrow = nullptr;
    if (FAILED(value.text->QueryInterface(__uuidof(ICadroNarrowText), reinterpret_cast<void **>(&narrow))))
        return L"<no narrow interface>";
    std::string s = narrow->Chars();
    narrow->Release();
    return std::wstring(s.begin(), s.end());
}

HRESULT STDMETHODCALLTYPE Recorder::OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                           uint32_t timeLow, uint32_t timeHigh)
{
    Delivery d;
    d.kind = Delivery::Data;
    d.cookie = cookie;
    d.flags = flags;
    d.type = value->type;
    d.number = value->type == kCadroBoolean ? value->boolean : value->type == kCadroNumber ? value->number : 0;
    d.text = TextOf(*value);
    d.error = errorFlag;
    d.time = {timeLow, timeHigh};
    Record(d);
    if (onData)
        onData(cookie);
    return S_OK;
}

HRESULT STDMETHODCALLTYPE Recorder::OnAttributes(void *cookie, const CadroAttributes *attributes)
{
    Delivery d;
    d.kind = Delivery::Attributes;
    d.cookie = cookie;
    d.type = attributes->dataType;
    d.access = attributes->access;
    Record(d);
    return S_OK;
}

HRESULT STDMETHODCALLTYPE Recorder::StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t)
{
    Delivery d;
    d.kind = Delivery::Status;
    d.cookie = cookie;
    d.status = status;
    Record(d);
    return S_OK;
}

void Recorder::Record(Delivery d)
{
    std::lock_guard<std::mutex> l(m_lock);
    m_deliveries.push_back(std::move(d));
    m_changed.notify_all();
}

std::vector<Delivery> Recorder::Snapshot()
{
    std::lock_guard<std::mutex> l(m_lock);
    return m_deliveries;
}

size_t Recorder::Count(void *cookie, Delivery::Kind kind)
{
    std::lock_guard<std::mutex> l(m_lock);
    size_t n = 0;
    for (const auto &d : m_deliveries)
        n += d.cookie == cookie && d.kind == kind;
    return n;
}

bool Recorder::WaitFor(const std::function<bool(const std::vector<Delivery> &)> &pred, int timeoutMs)
{
    std::unique_lock<std::mutex> l(m_lock);
    return m_changed.wait_for(l, std::chrono::milliseconds(timeoutMs), [&] { return pred(m_deliveries); });
}
