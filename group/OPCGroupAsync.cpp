// The group's DA 2.0 asynchronous I/O, its IOPCDataCallback connection point,
// the work of the transactions and the update scan.
#include "AsyncIOMgr.h"
#include "ComEnum2.h"
#include "ComUtil.h"
#include "Delivery.h"
#include "IdMgr.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "TaskMem.h"
#include "Transaction.h"
#include "UpdateScanMgr.h"

#include <olectl.h>

// ---- Connection point ------------------------------------------------

STDMETHODIMP COPCGroup::FindConnectionPoint(REFIID riid, IConnectionPoint **ppCP)
{
    return GroupBoundary([&]() -> HRESULT { return m_callback.Find(riid, ppCP); });
}

STDMETHODIMP COPCGroup::EnumConnectionPoints(IEnumConnectionPoints **ppEnum)
{
    return GroupBoundary([&]() -> HRESULT { return m_callback.Enumerate(ppEnum); });
}

// ---- IOPCAsyncIO2 ----------------------------------------------------

HRESULT COPCGroup::QueueTransaction(std::unique_ptr<CTransaction> t)
{
    CAsyncIOMgr *manager = CAsyncIOMgr::Instance();
    if (!manager)
        return E_FAIL; // no server object any more
    manager->Enqueue(std::move(t));
    return S_OK;
}

std::vector<OPCHANDLE> COPCGroup::ActiveHandles()
{
    std::vector<OPCHANDLE> handles;
    handles.reserve(m_activeItems.size());
    for (COPCItem *item : m_activeItems)
        handles.push_back(item->ServerHandle());
    return handles;
}

HRESULT COPCGroup::QueueRequest(DWORD count, const OPCHANDLE *handles, const RequestChecks &checks, DWORD *pId,
                                HRESULT **ppErrors, const MakeTransaction &make)
{
    if (!IsWritableOut(pId) || !IsWritableOut(ppErrors))
        return E_INVALIDARG;
    *pId = 0;
    *ppErrors = nullptr;
    if (!checks.argumentsValid || !IsReadableArray(handles, count))
        return E_INVALIDARG;
    if (FAILED(checks.connection))
        return checks.connection;
    TaskMem<HRESULT> errors;
    if (!errors.Allocate(count))
        return E_OUTOFMEMORY;
    std::vector<DWORD> passed;
    for (DWORD i = 0; i < count; ++i) {
        COPCItem *item = FindItem(handles[i]);
        bool allowed = item && (checks.rights == 0 || (item->AccessRights() & checks.rights) == checks.rights);
        errors[i] = !item ? OPC_E_INVALIDHANDLE : !allowed ? OPC_E_BADRIGHTS : S_OK;
        if (errors[i] == S_OK)
            passed.push_back(i);
    }
    if (checks.allOrNothing ? passed.size() == count : !passed.empty()) {
        DWORD id = CIdMgr::Instance().GetId();
        std::unique_ptr<CTransaction> t;
        HRESULT hr = make(id, passed, t);
        if (SUCCEEDED(hr))
            hr = QueueTransaction(std::move(t));
        if (FAILED(hr))
            return hr; // the error array is freed with its holder
        *pId = id;
    }
    *ppErrors = errors.Detach();
    return passed.size() == count ? S_OK : S_FALSE;
}

HRESULT COPCGroup::QueueRefresh(OPCDATASOURCE source, HRESULT connection, DWORD *pId, const MakeRefresh &make)
{
    if (!IsWritableOut(pId))
        return E_INVALIDARG;
    *pId = 0;
    if (FAILED(connection))
        return connection;
    if (source != OPC_DS_CACHE && source != OPC_DS_DEVICE)
        return E_INVALIDARG;
    if (!m_active || m_activeItems.empty())
        return E_FAIL;
    DWORD id = CIdMgr::Instance().GetId();
    HRESULT hr = QueueTransaction(make(id));
    if (SUCCEEDED(hr))
        *pId = id;
    return hr;
}

HRESULT COPCGroup::CallbackConnection()
{
    return m_callback.IsFilled() ? S_OK : CONNECT_E_NOCONNECTION;
}

STDMETHODIMP COPCGroup::Read(DWORD dwCount, OPCHANDLE *phServer, DWORD dwTransactionID, DWORD *pdwCancelID,
                             HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        RequestChecks checks;
        checks.connection = CallbackConnection();
        checks.rights = OPC_READABLE;
        return QueueRequest(dwCount, phServer, checks, pdwCancelID, ppErrors,
                            [&](DWORD id, const std::vector<DWORD> &passed, std::unique_ptr<CTransaction> &made) {
                                std::vector<OPCHANDLE> handles;
                                for (DWORD i : passed)
                                    handles.push_back(phServer[i]);
                                made =
                                    std::make_unique<CRead2Transaction>(id, this, dwTransactionID, std::move(handles));
                                return S_OK;
                            });
    });
}

STDMETHODIMP COPCGroup::Write(DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues, DWORD dwTransactionID,
                              DWORD *pdwCancelID, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        RequestChecks checks;
        checks.argumentsValid = IsReadableArray(pItemValues, dwCount);
        checks.connection = CallbackConnection();
        checks.rights = OPC_WRITEABLE;
        return QueueRequest(dwCount, phServer, checks, pdwCancelID, ppErrors,
                            WriteTransaction<CWrite2Transaction>(dwTransactionID, phServer, pItemValues));
    });
}

STDMETHODIMP COPCGroup::Refresh2(OPCDATASOURCE dwSource, DWORD dwTransactionID, DWORD *pdwCancelID)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        return QueueRefresh(dwSource, CallbackConnection(), pdwCancelID, [&](DWORD id) {
            return std::make_unique<CRefresh2Transaction>(id, this, dwTransactionID, dwSource);
        });
    });
}

STDMETHODIMP COPCGroup::Cancel2(DWORD dwCancelID)
{
    return GroupBoundary([&]() -> HRESULT {
        // Only a transaction of this group: another group's ids are not
        // this client's to cancel.
        CAsyncIOMgr *manager = CAsyncIOMgr::Instance();
        std::unique_ptr<CTransaction> t = manager ? manager->RemoveById(dwCancelID, this) : nullptr;
        if (!t)
            return E_FAIL;
        return t->Cancel(); // destroyed unexecuted: nothing is sent
    });
}

STDMETHODIMP COPCGroup::SetEnable(BOOL bEnable)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!m_callback.IsFilled())
            return CONNECT_E_NOCONNECTION;
        m_enable = bEnable;
        return S_OK;
    });
}

STDMETHODIMP COPCGroup::GetEnable(BOOL *pbEnable)
{
    return GroupBoundary([&]() -> HRESULT {
        if (!IsWritableOut(pbEnable))
            return E_FAIL;
        CSingleLock lock(&m_lock);
        *pbEnable = m_enable;
        return m_callback.IsFilled() ? S_OK : CONNECT_E_NOCONNECTION;
    });
}

// ---- Transactions ----------------------------------------------------

HRESULT COPCGroup::SendReadResults(CSingleLock &lock, DWORD clientId, OPCDATASOURCE source,
                                   const std::vector<OPCHANDLE> &handles, ReadCallback callback)
{
    std::vector<ReadResult> results;
    HRESULT overall = ReadPass(source, static_cast<DWORD>(handles.size()), handles.data(), results);
    Delivery d(std::move(results));
    CSinkRef<IOPCDataCallback> sink = m_callback.Sink<IOPCDataCallback>();
    if (!sink)
        return E_FAIL;
    OPCHANDLE hGroup = m_clientHandle;
    CallbackInFlight inFlight(*this);
    lock.Unlock();
    return (sink.Get()->*callback)(clientId, hGroup, d.MasterQuality(d.Count()), overall, d.Count(), d.clients.data(),
                                   d.values.data(), d.qualities.data(), d.times.data(), d.errors.data());
}

HRESULT COPCGroup::ExecuteRead2(DWORD clientId, const std::vector<OPCHANDLE> &handles)
{
    CSingleLock lock(&m_lock);
    return SendReadResults(lock, clientId, OPC_DS_DEVICE, handles, &IOPCDataCallback::OnReadComplete);
}

HRESULT COPCGroup::ExecuteWrite2(DWORD clientId, const std::vector<OPCHANDLE> &handles,
                                 const std::vector<VARIANT> &values)
{
    CSingleLock lock(&m_lock);
    WriteResults w(handles.size());
    WritePass(handles, values, w);
    CSinkRef<IOPCDataCallback> sink = m_callback.Sink<IOPCDataCallback>();
    if (!sink)
        return E_FAIL;
    OPCHANDLE hGroup = m_clientHandle;
    CallbackInFlight inFlight(*this);
    lock.Unlock();
    return sink->OnWriteComplete(clientId, hGroup, w.overall, w.Count(), w.clients.data(), w.errors.data());
}

HRESULT COPCGroup::ExecuteRefresh2(DWORD clientId, OPCDATASOURCE source)
{
    CSingleLock lock(&m_lock);
    if (!m_active)
        return S_OK; // made inactive meanwhile: nothing is sent
    return SendReadResults(lock, clientId, source, ActiveHandles(), &IOPCDataCallback::OnDataChange);
}

// ---- The update scan -------------------------------------------------

void COPCGroup::SetFailedScans(DWORD count)
{
    CSingleLock lock(&m_lock);
    m_failedScans = count;
}

DWORD COPCGroup::IncrementFailedScans()
{
    CSingleLock lock(&m_lock);
    return ++m_failedScans;
}

namespace {
// Empties the rows a scan used, whichever way it ends.
class UsedRows {
public:
    explicit UsedRows(Delivery &rows) : m_rows(rows) {}
    ~UsedRows() { m_rows.ClearValues(m_used); }
    UsedRows(const UsedRows &) = delete;
    UsedRows &operator=(const UsedRows &) = delete;
    void Set(size_t n) { m_used = n; }

private:
    Delivery &m_rows;
    size_t m_used = 0;
};
} // namespace

BOOL COPCGroup::Scan(LONGLONG &next, Delivery &d)
{
    CSingleLock lock(&m_lock);
    if (!m_active)
        return FALSE;
    next = CUpdateScanMgr::Now() + static_cast<LONGLONG>(m_updateRate) * CUpdateScanMgr::TicksPerMs();
    d.Resize(m_activeItems.size());
    UsedRows used(d);
    size_t n = 0;
    for (COPCItem *item : m_activeItems) {
        bool changed = false;
        HRESULT hr =
            item->CheckChanged(m_deadbandFraction, &d.clients[n], &d.values[n], &d.qualities[n], &d.times[n], &changed);
        d.errors[n] = hr;
        if (changed)
            ++n; // an unchanged item leaves its row's value empty
    }
    if (n == 0)
        return TRUE; // nothing changed: nothing is sent
    used.Set(n);

    HRESULT callbackResult = S_FALSE;
    CSinkRef<IOPCDataCallback> sink = m_enable ? m_callback.Sink<IOPCDataCallback>() : nullptr;
    if (sink) {
        HRESULT masterError = S_OK;
        for (size_t i = 0; i < n; ++i) {
            if (d.errors[i] != S_OK) {
                masterError = S_FALSE;
                VariantClear(&d.values[i]);
            }
        }
        OPCHANDLE hGroup = m_clientHandle;
        CallbackInFlight inFlight(*this);
        lock.Unlock();
        callbackResult =
            sink->OnDataChange(0, hGroup, d.MasterQuality(n), masterError, static_cast<DWORD>(n), d.clients.data(),
                               d.values.data(), d.qualities.data(), d.times.data(), d.errors.data());
        // Let go before the lock is taken again: a sink unadvised meanwhile
        // has its last release here, which must not run under the lock.
        sink.Reset();
        lock.Lock();
    }
    HRESULT adviseResult = NotifyAdviseSinks(lock, static_cast<DWORD>(n), d.clients.data(), d.values.data(),
                                             d.qualities.data(), d.times.data());
    if (callbackResult == S_OK || adviseResult == S_OK) {
        // Recorded under a lock of the owner's own: never the server lock.
        lock.Lock();
        if (m_owner && m_owner->EnterGroupCall()) {
            CGroupOwner *owner = m_owner;
            lock.Unlock();
            FILETIME now;
            GetSystemTimeAsFileTime(&now);
            owner->SetLastUpdateTime(now);
            owner->LeaveGroupCall();
        }
        return TRUE;
    }
    return callbackResult == S_FALSE && adviseResult == S_FALSE ? TRUE : FALSE;
}
