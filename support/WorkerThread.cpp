#include "WorkerThread.h"

#include "Trace.h"

#include <objbase.h>

void NameThisThread(const wchar_t *name)
{
    // Looked up, not imported: older systems lack it.
    using Describe = HRESULT(WINAPI *)(HANDLE, PCWSTR);
    static const auto describe = reinterpret_cast<Describe>(
        reinterpret_cast<void *>(GetProcAddress(GetModuleHandleW(L"kernel32.dll"), "SetThreadDescription")));
    if (describe)
        describe(GetCurrentThread(), name);
}

HRESULT CWorkerThread::Start(const wchar_t *name, Body body)
{
    m_name = name;
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
    NameThisThread(worker->m_name);
    // Callbacks to clients are COM calls: the thread joins the MTA.
    HRESULT hr = CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    worker->m_body(worker->m_stop.Get());
    if (SUCCEEDED(hr))
        CoUninitialize();
    return 0;
}
