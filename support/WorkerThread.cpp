#include "WorkerThread.h"

#include "Trace.h"

#include <objbase.h>

HRESULT CWorkerThread::Start(Body body)
{
    m_body = std::move(body);
    m_stop.Reset(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    if (!m_stop)
        return HRESULT_FROM_WIN32(GetLastError());
    m_thread.Reset(CreateThread(nullptr, 0, ThreadProc, this, 0, &m_threadId));
    if (!m_thread) {
        HRESULT hr = HRESULT_FROM_WIN32(GetLastError());
        INTERNAL_ASSERT_FAILED("CreateThread");
        m_stop.Reset();
        return hr;
    }
    return S_OK;
}

void CWorkerThread::Stop()
{
    if (!m_thread)
        return;
    SetEvent(m_stop.Get());
    // A thread that stops itself from its own body must not wait for itself.
    if (GetCurrentThreadId() != m_threadId && WaitForSingleObject(m_thread.Get(), INFINITE) != WAIT_OBJECT_0)
        INTERNAL_ASSERT_FAILED("wait for worker thread");
    m_thread.Reset();
    m_stop.Reset();
}

DWORD WINAPI CWorkerThread::ThreadProc(void *self)
{
    auto *worker = static_cast<CWorkerThread *>(self);
    // Callbacks to clients are COM calls: the thread joins the MTA.
    HRESULT hr = CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    worker->m_body(worker->m_stop.Get());
    if (SUCCEEDED(hr))
        CoUninitialize();
    return 0;
}
