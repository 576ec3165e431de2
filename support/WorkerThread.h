#pragma once
// One Win32 thread with a stop event. The body runs until the stop event is
// signalled; Stop waits for the thread to end.
#include "Handle.h"

#include <functional>

// Names the calling thread for debuggers and the system's thread list (under
// Wine, /proc/PID/task/TID/comm).
void NameThisThread(const wchar_t *name);

class CWorkerThread {
public:
    using Body = std::function<void(HANDLE stopEvent)>;

    CWorkerThread() = default;
    ~CWorkerThread() { Stop(); }
    CWorkerThread(const CWorkerThread &) = delete;
    CWorkerThread &operator=(const CWorkerThread &) = delete;

    // The thread is named name (debuggers and the system's thread list show it).
    HRESULT Start(const wchar_t *name, Body body);
    void Stop();
    DWORD ThreadId() const { return m_threadId; }

private:
    static DWORD WINAPI ThreadProc(void *self);

    const wchar_t *m_name = nullptr;
    Body m_body;
    UniqueHandle m_stop;
    UniqueHandle m_thread;
    DWORD m_threadId = 0;
};
