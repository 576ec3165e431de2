#pragma once
// A real-time receiver that records every callback, for the simulator tests.
#include "CadroNetwork.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <vector>

struct Delivery {
    enum Kind { Status, Attributes, Data } kind = Status;
    void *cookie = nullptr;
    uint32_t status = 0; // Status
    uint32_t flags = 0;  // Data
    uint32_t type = 0;   // Data: value type; Attributes: data type
    double number = 0;   // Data
    std::wstring text;   // Data (text values)
    int32_t error = 0;   // Data
    FILETIME time = {};  // Data
    uint32_t access = 0; // Attributes
};

class Recorder : public ICadroRealTimeReceiver {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override;
    STDMETHODIMP_(ULONG) AddRef() override { return ++m_refs; }
    STDMETHODIMP_(ULONG) Release() override { return --m_refs; } // lives on the test's stack
    HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                     uint32_t timeLow, uint32_t timeHigh) override;
    HRESULT STDMETHODCALLTYPE OnAttributes(void *cookie, const CadroAttributes *attributes) override;
    HRESULT STDMETHODCALLTYPE StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t) override;

    std::vector<Delivery> Snapshot();
    size_t Count(void *cookie, Delivery::Kind kind);
    // Waits up to timeoutMs for pred over the recorded deliveries.
    bool WaitFor(const std::function<bool(const std::vector<Delivery> &)> &pred, int timeoutMs = 5000);
    // Called inside OnData, after recording (for re-entrancy tests).
    std::function<void(void *cookie)> onData;
    ULONG Refs() const { return m_refs; }

private:
    void Record(Delivery d);
    std::mutex m_lock;
    std::condition_variable m_changed;
    std::vector<Delivery> m_deliveries;
    std::atomic<ULONG> m_refs{1};
};

// Text of a text value record.
std::wstring TextOf(const CadroValue &value);
