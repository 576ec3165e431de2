#include "SinkRelease.h"

#include "Handle.h"
#include "SyncObject.h"
#include "WorkerThread.h"

#include <objbase.h>

#include <thread>
#include <vector>

namespace {
// Long after the end of any call on the sink in the client: the client's
// thread only has to lower a count after sending its answer.
constexpr ULONGLONG kDelayMs = 1000;

struct Waiting {
    IUnknown *sink;
    ULONGLONG due;
};

class CReleaser {
public:
    void Add(IUnknown *sink)
    {
        CSingleLock lock(&m_lock);
        if (m_stopped) {
            lock.Unlock();
            sink->Release(); // the process is leaving: nothing calls sinks any more
            return;
        }
        m_waiting.push_back({sink, GetTickCount64() + kDelayMs});
        if (!m_thread.joinable())
            m_thread = std::thread([this] {
                NameThisThread(L"sink release");
                Run();
            });
        else if (m_waiting.size() == 1)
            SetEvent(m_wake.Get());
    }

    void Flush()
    {
        std::vector<Waiting> all;
        {
            CSingleLock lock(&m_lock);
            m_stopped = true;
            all.swap(m_waiting);
            SetEvent(m_wake.Get());
        }
        for (const Waiting &w : all)
            w.sink->Release();
        if (m_thread.joinable())
            m_thread.join();
    }

private:
    void Run()
    {
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        for (;;) {
            std::vector<IUnknown *> due;
            DWORD waitMs = INFINITE;
            {
                CSingleLock lock(&m_lock);
                if (m_stopped)
                    break;
                ULONGLONG now = GetTickCount64();
                // In the order they came, each with the same delay: the due
                // ones are at the front.
                size_t n = 0;
                while (n < m_waiting.size() && m_waiting[n].due <= now)
                    due.push_back(m_waiting[n++].sink);
                m_waiting.erase(m_waiting.begin(), m_waiting.begin() + static_cast<ptrdiff_t>(n));
                if (!m_waiting.empty())
                    waitMs = static_cast<DWORD>(m_waiting.front().due - now);
            }
            for (IUnknown *sink : due)
                sink->Release();
            WaitForSingleObject(m_wake.Get(), waitMs);
        }
        CoUninitialize();
    }

    CCriticalSection m_lock{LockOrder::Leaf};
    UniqueHandle m_wake{CreateEventW(nullptr, FALSE, FALSE, nullptr)};
    std::vector<Waiting> m_waiting;
    bool m_stopped = false;
    std::thread m_thread;
};

CReleaser &Releaser()
{
    // Never destroyed: sinks may be let go until the process ends.
    static CReleaser *releaser = new CReleaser();
    return *releaser;
}
} // namespace

bool SinkRelease::IsRemote(IUnknown *sink)
{
    IMultiQI *proxy = nullptr;
    if (!sink || FAILED(sink->QueryInterface(IID_IMultiQI, reinterpret_cast<void **>(&proxy))) || !proxy)
        return false;
    proxy->Release();
    return true;
}

void SinkRelease::Release(IUnknown *sink, bool remote)
{
    if (!sink)
        return;
    if (remote)
        Releaser().Add(sink);
    else
        sink->Release();
}

void SinkRelease::Flush()
{
    Releaser().Flush();
}
