#pragma once
// An IAdviseSink that keeps a copy of every stream it receives.
#include <objidl.h>

#include <chrono>
#include <condition_variable>
#include <cstring>
#include <functional>
#include <mutex>
#include <vector>

struct ReceivedStream {
    CLIPFORMAT format;
    std::vector<BYTE> bytes;
    std::vector<BYTE> device; // the format's target device, when it has one
    DWORD At(size_t offset) const
    {
        DWORD v = 0;
        if (offset + 4 <= bytes.size())
            memcpy(&v, &bytes[offset], 4);
        return v;
    }
};

class TestAdviseSink : public IAdviseSink {
public:
    TestAdviseSink() = default;
    TestAdviseSink(const TestAdviseSink &) = delete;
    TestAdviseSink &operator=(const TestAdviseSink &) = delete;
    // Its stubs go with it (see TestSink).
    ~TestAdviseSink() { CoDisconnectObject(static_cast<IAdviseSink *>(this), 0); }
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IAdviseSink)) {
            *ppv = static_cast<IAdviseSink *>(this);
            AddRef();
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; }
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    STDMETHODIMP_(void) OnDataChange(FORMATETC *format, STGMEDIUM *medium) override
    {
        ReceivedStream s{format ? format->cfFormat : CLIPFORMAT(0), {}, {}};
        if (format && format->ptd) {
            const BYTE *device = reinterpret_cast<const BYTE *>(format->ptd);
            s.device.assign(device, device + format->ptd->tdSize);
        }
        if (medium && medium->tymed == TYMED_HGLOBAL && medium->hGlobal) {
            SIZE_T size = GlobalSize(medium->hGlobal);
            const BYTE *p = static_cast<const BYTE *>(GlobalLock(medium->hGlobal));
            if (p)
                s.bytes.assign(p, p + size);
            GlobalUnlock(medium->hGlobal);
        }
        {
            std::lock_guard<std::mutex> l(m_lock);
            m_streams.push_back(std::move(s));
            m_changed.notify_all();
        }
        if (onData)
            onData();
    }
    // Runs inside OnDataChange after recording (re-entrancy tests).
    std::function<void()> onData;
    STDMETHODIMP_(void) OnViewChange(DWORD, LONG) override {}
    STDMETHODIMP_(void) OnRename(IMoniker *) override {}
    STDMETHODIMP_(void) OnSave() override {}
    STDMETHODIMP_(void) OnClose() override {}

    std::vector<ReceivedStream> Streams()
    {
        std::lock_guard<std::mutex> l(m_lock);
        return m_streams;
    }
    template <class Pred> bool WaitFor(Pred pred, int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> l(m_lock);
        return m_changed.wait_for(l, std::chrono::milliseconds(timeoutMs), [&] { return pred(m_streams); });
    }

private:
    std::mutex m_lock;
    std::condition_variable m_changed;
    std::vector<ReceivedStream> m_streams;
};
