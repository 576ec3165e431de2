#pragma once
// One Win32 thread with a stop event. The body runs until the stop event is
// signalled; Stop waits for the thread to end.
#include "Handle.h"

#include <functional>

class CWorkerThread {
public:
    using Body = std::function<void(HANDLE stopEvent)>;

    CWorkerThread() = default;
    ~CWorkerThread() { Stop(); }
    CWorkerThread(const CWorkerThread &) = delete;
    CWorkerThread &operator=(const CWorkerThread &) = delete;

    HRESULT Start(Body body);
    void Stop();
    DWORD ThreadId() const { return m_threadId; }

private:
    static DWORD WINAPI ThreadProc(void *self);

    Body m_body;
    UniqueHandle m_stop;
    UniqueHandle m_thread;
    DWORD m_threadId = 0;
};
