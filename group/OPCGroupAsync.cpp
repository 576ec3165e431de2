// The group's DA 2.0 asynchronous I/O, its IOPCDataCallback connection point,
// the work of the transactions and the update scan.
#include "AsyncIOMgr.h"
#include "ComEnum2.h"
#include "ComUtil.h"
#include "IdMgr.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "TaskMem.h"
#include "Transaction.h"
#include "UpdateScanMgr.h"

#include <olectl.h>

namespace {
// Arrays of one delivery, filled from the read pass or the change check.
struct Delivery {
    std::vector<OPCHANDLE> clients;
    std::vector<VARIANT> values;
    std::vector<WORD> qualities;
    std::vector<FILETIME> times;
    std::vector<HRESULT> errors;

    explicit Delivery(size_t n) : clients(n), values(n), qualities(n), times(n), errors(n)
    {
        for (VARIANT &v : values)
            VariantInit(&v);
    }
    ~Delivery()
    {
        for (VARIANT &v : values)
            VariantClear(&v);
    }
    void From(const std::vector<COPCGroup::ReadResult> &results)
    {
        for (size_t i = 0; i < results.size(); ++i) {
            clients[i] = results[i].client;
            values[i] = results[i].value; // moved in; cleared with the delivery
            qualities[i] = results[i].quality;
            times[i] = results[i].time;
            errors[i] = results[i].error;
        }
    }
    // S_OK when every quality is exactly good.
    HRESULT MasterQuality(size_t n) const
    {
        for (size_t i = 0; i < n; ++i)
            if (qualities[i] != OPC_QUALITY_GOOD)
                return S_FALSE;
        return S_OK;
    }
};

} // namespace

// ---- Connection point ------------------------------------------------

STDMETHODIMP COPCGroup::FindConnectionPoint(REFIID riid, IConnectionPoint **ppCP)
{
    return FindSingleSinkPoint(&m_callback, InnerUnknown(), riid, ppCP);
}

STDMETHODIMP COPCGroup::EnumConnectionPoints(IEnumConnectionPoints **ppEnum)
{
    return EnumSingleSinkPoint(&m_callback, InnerUnknown(), ppEnum);
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

template <class Check> HRESULT COPCGroup::CheckItems(DWORD count, const OPCHANDLE *handles, DWORD *cancelId,
                                                     HRESULT **ppErrors, TaskMem<HRESULT> &errors,
                                                     std::vector<DWORD> &passed, Check check)
{
    if (m_removing)
        return E_FAIL;
    if (!IsWritableOut(cancelId) || !IsWritableOut(ppErrors))
        return E_INVALIDARG;
    *cancelId = 0;
    *ppErrors = nullptr;
    if (!IsReadableArray(handles, count))
        return E_INVALIDARG;
    if (!m_callback.IsFilled())
        return CONNECT_E_NOCONNECTION;
    if (!errors.Allocate(count))
        return E_OUTOFMEMORY;
    for (DWORD i = 0; i < count; ++i) {
        COPCItem *item = FindItem(handles[i]);
        errors[i] = !item ? OPC_E_INVALIDHANDLE : !check(*item) ? OPC_E_BADRIGHTS : S_OK;
        if (errors[i] == S_OK)
            passed.push_back(i);
    }
    return S_OK;
}

STDMETHODIMP COPCGroup::Read(DWORD dwCount, OPCHANDLE *phServer, DWORD dwTransactionID, DWORD *pdwCancelID,
                             HRESULT **ppErrors)
{
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        TaskMem<HRESULT> errors;
        std::vector<DWORD> passed;
        HRESULT hr = CheckItems(dwCount, phServer, pdwCancelID, ppErrors, errors, passed,
                                [](COPCItem &item) { return (item.AccessRights() & OPC_READABLE) != 0; });
        if (FAILED(hr))
            return hr;
        if (!passed.empty()) {
            std::vector<OPCHANDLE> handles;
            for (DWORD i : passed)
                handles.push_back(phServer[i]);
            DWORD id = CIdMgr::Instance().GetId();
            hr = QueueTransaction(std::make_unique<CRead2Transaction>(id, this, dwTransactionID, std::move(handles)));
            if (FAILED(hr))
                return hr;
            *pdwCancelID = id;
        }
        *ppErrors = errors.Detach();
        return passed.size() == dwCount ? S_OK : S_FALSE;
    });
}

STDMETHODIMP COPCGroup::Write(DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues, DWORD dwTransactionID,
                              DWORD *pdwCancelID, HRESULT **ppErrors)
{
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!m_removing && IsWritableOut(pdwCancelID) && IsWritableOut(ppErrors) &&
            !IsReadableArray(pItemValues, dwCount)) {
            *pdwCancelID = 0;
            *ppErrors = nullptr;
            return E_INVALIDARG;
        }
        TaskMem<HRESULT> errors;
        std::vector<DWORD> passed;
        HRESULT hr = CheckItems(dwCount, phServer, pdwCancelID, ppErrors, errors, passed,
                                [](COPCItem &item) { return (item.AccessRights() & OPC_WRITEABLE) != 0; });
        if (FAILED(hr))
            return hr;
        if (!passed.empty()) {
            DWORD id = CIdMgr::Instance().GetId();
            auto t = std::make_unique<CWrite2Transaction>(id, this, dwTransactionID);
            hr = t->Add(phServer, pItemValues, passed);
            if (FAILED(hr))
                return hr; // the error array is freed with its holder
            hr = QueueTransaction(std::move(t));
            if (FAILED(hr))
                return hr;
            *pdwCancelID = id;
        }
        *ppErrors = errors.Detach();
        return passed.size() == dwCount ? S_OK : S_FALSE;
    });
}

STDMETHODIMP COPCGroup::Refresh2(OPCDATASOURCE dwSource, DWORD dwTransactionID, DWORD *pdwCancelID)
{
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (m_removing)
            return E_FAIL;
        if (!IsWritableOut(pdwCancelID))
            return E_INVALIDARG;
        *pdwCancelID = 0;
        if (!m_callback.IsFilled())
            return CONNECT_E_NOCONNECTION;
        if (dwSource != OPC_DS_CACHE && dwSource != OPC_DS_DEVICE)
            return E_INVALIDARG;
        if (!m_active || m_activeItems.empty())
            return E_FAIL;
        DWORD id = CIdMgr::Instance().GetId();
        HRESULT hr = QueueTransaction(std::make_unique<CRefresh2Transaction>(id, this, dwTransactionID, dwSource));
        if (SUCCEEDED(hr))
            *pdwCancelID = id;
        return hr;
    });
}

STDMETHODIMP COPCGroup::Cancel2(DWORD dwCancelID)
{
    return ComBoundary([&]() -> HRESULT {
        {
            CSingleLock lock(&m_lock);
            if (m_removing)
                return E_FAIL;
        }
        CAsyncIOMgr *manager = CAsyncIOMgr::Instance();
        std::unique_ptr<CTransaction> t = manager ? manager->RemoveById(dwCancelID) : nullptr;
        if (!t)
            return E_FAIL;
        return t->Cancel(); // destroyed unexecuted: nothing is sent
    });
}

STDMETHODIMP COPCGroup::SetEnable(BOOL bEnable)
{
    CSingleLock lock(&m_lock);
    if (m_removing)
        return E_FAIL;
    if (!m_callback.IsFilled())
        return CONNECT_E_NOCONNECTION;
    m_enable = bEnable;
    return S_OK;
}

STDMETHODIMP COPCGroup::GetEnable(BOOL *pbEnable)
{
    CSingleLock lock(&m_lock);
    if (!IsWritableOut(pbEnable) || m_removing)
        return E_FAIL;
    *pbEnable = m_enable;
    return m_callback.IsFilled() ? S_OK : CONNECT_E_NOCONNECTION;
}

// ---- Transactions ----------------------------------------------------

HRESULT COPCGroup::SendReadResults(CSingleLock &lock, DWORD clientId, OPCDATASOURCE source,
                                   const std::vector<OPCHANDLE> &handles, ReadCallback callback)
{
    std::vector<ReadResult> results;
    HRESULT overall = ReadPass(source, static_cast<DWORD>(handles.size()), handles.data(), results);
    Delivery d(results.size());
    d.From(results);
    ComPtr<IOPCDataCallback> sink = m_callback.Sink<IOPCDataCallback>();
    if (!sink)
        return E_FAIL;
    OPCHANDLE hGroup = m_clientHandle;
    CallbackInFlight inFlight(*this);
    lock.Unlock();
    DWORD n = static_cast<DWORD>(results.size());
    return (sink.Get()->*callback)(clientId, hGroup, d.MasterQuality(n), overall, n, d.clients.data(), d.values.data(),
                                   d.qualities.data(), d.times.data(), d.errors.data());
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
    DWORD n = static_cast<DWORD>(handles.size());
    std::vector<HRESULT> errors(n);
    std::vector<OPCHANDLE> clients(n, 0xFFFFFFFF);
    HRESULT overall = WritePass(n, handles.data(), values.data(), errors.data(), clients.data());
    ComPtr<IOPCDataCallback> sink = m_callback.Sink<IOPCDataCallback>();
    if (!sink)
        return E_FAIL;
    OPCHANDLE hGroup = m_clientHandle;
    CallbackInFlight inFlight(*this);
    lock.Unlock();
    return sink->OnWriteComplete(clientId, hGroup, overall, n, clients.data(), errors.data());
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

void COPCGroup::ReleaseScanEntry()
{
    ReleasePendingWork();
    InnerUnknown()->Release();
}

BOOL COPCGroup::Scan(LONGLONG &next)
{
    CSingleLock lock(&m_lock);
    if (!m_active)
        return FALSE;
    next = CUpdateScanMgr::Now() + static_cast<LONGLONG>(m_updateRate) * CUpdateScanMgr::TicksPerMs();
    Delivery d(m_activeItems.size());
    size_t n = 0;
    for (COPCItem *item : m_activeItems) {
        bool changed = false;
        HRESULT hr =
            item->CheckChanged(m_deadbandFraction, &d.clients[n], &d.values[n], &d.qualities[n], &d.times[n], &changed);
        d.errors[n] = hr;
        if (changed)
            ++n;
        else
            VariantClear(&d.values[n]);
    }
    if (n == 0)
        return TRUE; // nothing changed: nothing is sent

    HRESULT callbackResult = S_FALSE;
    ComPtr<IOPCDataCallback> sink = m_enable ? m_callback.Sink<IOPCDataCallback>() : nullptr;
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
        lock.Lock();
    }
    HRESULT adviseResult =
        NotifyAdviseSinks(static_cast<DWORD>(n), d.clients.data(), d.values.data(), d.qualities.data(), d.times.data());
    if (callbackResult == S_OK || adviseResult == S_OK) {
        // Recorded without the server lock, which a removal of this group
        // may hold while it waits.
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
