#pragma once
// The baseline server (baseline_server.cpp) as a process of its own, started
// by a benchmark, and its object as the benchmark reaches it: through COM
// across the process boundary, as a client reaches our server.
#include "ComPtr.h"
#include "Handle.h"

#include <windows.h>

#include <string>

class BaselineProcess {
public:
    // Starts baseline_server.exe (beside this program) for deliveries of n
    // items, sent from a thread of the multithreaded apartment or, with
    // singleThreaded, from a thread of an apartment of its own; Ready() tells
    // whether its object came.
    explicit BaselineProcess(DWORD n, bool singleThreaded = false);
    // Lets go of the object and waits a while for the process, which ends
    // once released.
    ~BaselineProcess();
    BaselineProcess(const BaselineProcess &) = delete;
    BaselineProcess &operator=(const BaselineProcess &) = delete;

    bool Ready() const { return m_object.Get() != nullptr; }
    HANDLE Process() const { return m_process.Get(); }
    // One of the object's interfaces (null when it has none of that kind).
    template <class I> ComPtr<I> Query(REFIID iid) const
    {
        ComPtr<I> out;
        if (m_object)
            m_object->QueryInterface(iid, reinterpret_cast<void **>(out.Out()));
        return out;
    }

private:
    void Unmarshal(const std::string &hex);

    UniqueHandle m_process;
    ComPtr<IUnknown> m_object;
};
