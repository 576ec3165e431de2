#pragma once
// An IOPCDataCallback that records every callback, for tests in process and
// across the process boundary.
#include "opcda.h"

#include <windows.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <vector>

struct Callback {
    enum Kind { DataChange, ReadComplete, WriteComplete, CancelComplete } kind = DataChange;
    DWORD transid = 0;
    OPCHANDLE group = 0;
    HRESULT masterQuality = S_OK;
    HRESULT masterError = S_OK;
    std::vector<OPCHANDLE> clients;
    std::vector<double> values; // VT_R8 values; NaN for others
    std::vector<WORD> qualities;
    std::vector<HRESULT> errors;
    DWORD thread = 0;
};

class TestSink : public IOPCDataCallback {
public:
    TestSink() = default;
    TestSink(const TestSink &) = delete;
    TestSink &operator=(const TestSink &) = delete;
    // A sink lives in its test, often on the stack, while a server may not
    // have let go of it yet (it releases sinks on a thread of its own): its
    // stubs go now, so that a late release finds nothing rather than a
    // destroyed object.
    ~TestSink() { CoDisconnectObject(static_cast<IOPCDataCallback *>(this), 0); }
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return ++m_refs; }
    STDMETHODIMP_(ULONG) Release() override { return --m_refs; } // lives in the test
    STDMETHODIMP OnDataChange(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMasterquality, HRESULT hrMastererror,
                              DWORD dwCount, OPCHANDLE *phClientItems, VARIANT *pvValues, WORD *pwQualities,
                              FILETIME *pftTimeStamps, HRESULT *pErrors) override;
    STDMETHODIMP OnReadComplete(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMasterquality, HRESULT hrMastererror,
                                DWORD dwCount, OPCHANDLE *phClientItems, VARIANT *pvValues, WORD *pwQualities,
                                FILETIME *pftTimeStamps, HRESULT *pErrors) override;
    STDMETHODIMP OnWriteComplete(DWORD dwTransid, OPCHANDLE hGroup, HRESULT hrMastererr, DWORD dwCount,
                                 OPCHANDLE *pClienthandles, HRESULT *pErrors) override;
    STDMETHODIMP OnCancelComplete(DWORD dwTransid, OPCHANDLE hGroup) override;

    std::vector<Callback> Snapshot();
    size_t Count(Callback::Kind kind);
    bool WaitFor(const std::function<bool(const std::vector<Callback> &)> &pred, int timeoutMs = 10000);

    // Result of OnDataChange (a failing client).
    std::atomic<HRESULT> dataChangeResult{S_OK};
    // Runs inside OnDataChange after recording (re-entrancy tests).
    std::function<void()> onDataChange;
    // Runs inside OnReadComplete, after recording, with the transaction id.
    std::function<void(DWORD)> onReadComplete;
    ULONG Refs() const { return m_refs; }

private:
    HRESULT Record(Callback c, DWORD count, VARIANT *values, WORD *qualities, HRESULT *errors);
    std::mutex m_lock;
    std::condition_variable m_changed;
    std::vector<Callback> m_calls;
    std::atomic<ULONG> m_refs{1};
};
