#include "AsyncIOMgr.h"

#include "Trace.h"
#include "Transaction.h"

#include <iterator>

CAsyncIOMgr::CAsyncIOMgr() : m_work(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    if (!m_work)
        INTERNAL_ASSERT_FAILED("CreateEvent for the transaction work event");
}

CAsyncIOMgr::~CAsyncIOMgr()
{
    // The transaction in progress, its callback included, finishes first;
    // the still queued ones are destroyed without completions.
    m_thread.Stop();
}

HRESULT CAsyncIOMgr::Start()
{
    if (FAILED(m_thread.Start(L"async I/O", [this](HANDLE stop) { Run(stop); })))
        INTERNAL_ASSERT_FAILED("transaction worker thread");
    return S_OK;
}

void CAsyncIOMgr::Enqueue(std::unique_ptr<CTransaction> transaction)
{
    CSingleLock lock(&m_lock);
    m_queue.push_back(std::move(transaction));
    if (!SetEvent(m_work.Get()))
        INTERNAL_ASSERT_FAILED("SetEvent for the transaction work event");
}

std::unique_ptr<CTransaction> CAsyncIOMgr::TakeNext()
{
    CSingleLock lock(&m_lock);
    if (m_queue.empty())
        return nullptr;
    std::unique_ptr<CTransaction> t = std::move(m_queue.front());
    m_queue.pop_front();
    if (m_queue.empty())
        ResetEvent(m_work.Get());
    return t;
}

std::unique_ptr<CTransaction> CAsyncIOMgr::RemoveById(DWORD id, const COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    for (auto it = m_queue.begin(); it != m_queue.end(); ++it) {
        if ((*it)->Id() == id && (*it)->Group() == group) {
            std::unique_ptr<CTransaction> t = std::move(*it);
            m_queue.erase(it);
            if (m_queue.empty())
                ResetEvent(m_work.Get());
            return t;
        }
    }
    return nullptr;
}

void CAsyncIOMgr::RemoveAllOf(const COPCGroup *group)
{
    std::list<std::unique_ptr<CTransaction>> removed; // destroyed after the lock
    {
        CSingleLock lock(&m_lock);
        for (auto it = m_queue.begin(); it != m_queue.end();) {
            auto next = std::next(it);
            if ((*it)->Group() == group)
                removed.splice(removed.end(), m_queue, it);
            it = next;
        }
        if (m_queue.empty())
            ResetEvent(m_work.Get());
    }
}

void CAsyncIOMgr::Run(HANDLE stopEvent)
{
    HANDLE events[] = {stopEvent, m_work.Get()};
    for (;;) {
        DWORD result = WaitForMultipleObjects(2, events, FALSE, INFINITE);
        if (result == WAIT_OBJECT_0)
            break;
        if (result != WAIT_OBJECT_0 + 1) {
            INTERNAL_ASSERT_FAILED("unexpected wait result in the transaction worker");
            continue;
        }
        if (std::unique_ptr<CTransaction> t = TakeNext())
            t->Execute(); // its result is ignored; destroyed here
    }
    while (TakeNext()) {
    }
}
