// The group's DA 1.0 asynchronous I/O and data-object advise: requests,
// advise connections of the three stream formats, and their senders.
#include "AsyncIOMgr.h"
#include "ComUtil.h"
#include "Delivery.h"
#include "IdMgr.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "StreamBuilder.h"
#include "TaskMem.h"
#include "Trace.h"
#include "Transaction.h"

#include <olectl.h>

namespace {
// Sends one HGLOBAL stream and frees it afterwards.
template <class Send> HRESULT SendStream(HGLOBAL memory, Send send)
{
    STGMEDIUM medium = {};
    medium.tymed = TYMED_HGLOBAL;
    medium.hGlobal = memory;
    HRESULT hr = send(medium);
    if (GlobalFree(memory))
        INTERNAL_ASSERT_FAILED("GlobalFree of a sent stream");
    return hr;
}
} // namespace

// ---- Senders ---------------------------------------------------------
//
// The streams are built under the group lock; the sinks are called after it
// is released, as IOPCDataCallback is: a sink may call the group back from
// another thread of its process, and a removal may be waiting meanwhile.

void COPCGroup::SendStreams(CSingleLock &lock, StreamSend *sends, size_t count)
{
    CallbackInFlight inFlight(*this);
    lock.Unlock();
    for (size_t i = 0; i < count; ++i)
        if (sends[i].memory)
            SendStream(sends[i].memory, [&](STGMEDIUM &m) {
                SendToConnections(sends[i].connections, m);
                return S_OK;
            });
}

HRESULT COPCGroup::NotifyAdviseSinks(CSingleLock &lock, DWORD count, const OPCHANDLE *clients, const VARIANT *values,
                                     const WORD *qualities, const FILETIME *times)
{
    StreamSend sends[2];
    bool any = false;
    for (int i = 0; i < 2; ++i) {
        bool withTime = i == 0; // the connections with time stamps first
        sends[i].connections = (withTime ? m_dataTimeAdvise : m_dataAdvise).All();
        if (sends[i].connections.empty())
            continue;
        any = true;
        HRESULT hr = OpcStreams::BuildData(withTime, m_clientHandle, 0, count, clients, values, qualities, times,
                                           &sends[i].memory);
        if (FAILED(hr)) {
            INTERNAL_ASSERT_FAILED("building a data stream");
            for (StreamSend &built : sends)
                if (built.memory)
                    GlobalFree(built.memory);
            lock.Unlock();
            return withTime ? hr : E_FAIL;
        }
    }
    if (!any) {
        lock.Unlock();
        return S_FALSE;
    }
    SendStreams(lock, sends, 2);
    return S_OK;
}

HRESULT COPCGroup::SendReadComplete(CSingleLock &lock, DWORD connection, DWORD id, HRESULT overall, DWORD count,
                                    const OPCHANDLE *clients, const VARIANT *values, const WORD *qualities,
                                    const FILETIME *times)
{
    ConnectionList target = m_dataTimeAdvise.Find(connection);
    bool withTime = !target.empty();
    if (!withTime)
        target = m_dataAdvise.Find(connection);
    if (target.empty()) {
        lock.Unlock();
        return OLE_E_NOCONNECTION; // unadvised meanwhile
    }
    HGLOBAL memory = nullptr;
    HRESULT hr = OpcStreams::BuildData(withTime, m_clientHandle, id, FAILED(overall) ? 0 : count, clients, values,
                                       qualities, times, &memory);
    if (FAILED(hr)) {
        lock.Unlock();
        return hr;
    }
    StreamSend send{std::move(target), memory};
    SendStreams(lock, &send, 1);
    return S_OK;
}

HRESULT COPCGroup::SendWriteComplete(CSingleLock &lock, DWORD connection, DWORD id, HRESULT overall, DWORD count,
                                     const OPCHANDLE *clients, const HRESULT *errors)
{
    ConnectionList target = m_writeAdvise.Find(connection);
    if (target.empty()) {
        lock.Unlock();
        return OLE_E_NOCONNECTION;
    }
    HGLOBAL memory = nullptr;
    HRESULT hr =
        OpcStreams::BuildWriteComplete(m_clientHandle, id, FAILED(overall) ? 0 : count, clients, errors, &memory);
    if (FAILED(hr)) {
        lock.Unlock();
        return hr;
    }
    StreamSend send{std::move(target), memory};
    SendStreams(lock, &send, 1);
    return S_OK;
}

// ---- Transaction work ------------------------------------------------

HRESULT COPCGroup::ExecuteRead(DWORD connection, DWORD id, OPCDATASOURCE source, const std::vector<OPCHANDLE> &handles)
{
    CSingleLock lock(&m_lock);
    return ReadAndSend(lock, connection, id, source, handles);
}

HRESULT COPCGroup::ReadAndSend(CSingleLock &lock, DWORD connection, DWORD id, OPCDATASOURCE source,
                               const std::vector<OPCHANDLE> &handles)
{
    std::vector<ReadResult> results;
    HRESULT overall = ReadPass(source, static_cast<DWORD>(handles.size()), handles.data(), results);
    Delivery d(std::move(results));
    return SendReadComplete(lock, connection, id, overall, d.Count(), d.clients.data(), d.values.data(),
                            d.qualities.data(), d.times.data());
}

HRESULT COPCGroup::ExecuteWrite(DWORD connection, DWORD id, const std::vector<OPCHANDLE> &handles,
                                const std::vector<VARIANT> &values)
{
    CSingleLock lock(&m_lock);
    WriteResults w(handles.size());
    WritePass(handles, values, w);
    return SendWriteComplete(lock, connection, id, w.overall, w.Count(), w.clients.data(), w.errors.data());
}

HRESULT COPCGroup::ExecuteRefresh(DWORD connection, DWORD id, OPCDATASOURCE source)
{
    CSingleLock lock(&m_lock);
    if (!m_active)
        return S_OK; // nothing is sent for an inactive group
    return ReadAndSend(lock, connection, id, source, ActiveHandles());
}

// ---- IOPCAsyncIO -----------------------------------------------------

HRESULT COPCGroup::AdviseConnection(DWORD connection, bool write)
{
    if (write)
        return m_writeAdvise.Contains(connection) ? S_OK : OLE_E_NOCONNECTION;
    return m_dataTimeAdvise.Contains(connection) || m_dataAdvise.Contains(connection) ? S_OK : OLE_E_NOCONNECTION;
}

STDMETHODIMP COPCGroup::Read(DWORD dwConnection, OPCDATASOURCE dwSource, DWORD dwCount, OPCHANDLE *phServer,
                             DWORD *pTransactionID, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        RequestChecks checks;
        checks.argumentsValid = dwSource == OPC_DS_CACHE || dwSource == OPC_DS_DEVICE;
        checks.connection = AdviseConnection(dwConnection, false);
        checks.allOrNothing = true;
        return QueueRequest(dwCount, phServer, checks, pTransactionID, ppErrors,
                            [&](DWORD id, const std::vector<DWORD> &, std::unique_ptr<CTransaction> &made) {
                                made = std::make_unique<CReadTransaction>(
                                    id, this, dwConnection, dwSource,
                                    std::vector<OPCHANDLE>(phServer, phServer + dwCount));
                                return S_OK;
                            });
    });
}

STDMETHODIMP COPCGroup::Write(DWORD dwConnection, DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues,
                              DWORD *pTransactionID, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        RequestChecks checks;
        checks.argumentsValid = IsReadableArray(pItemValues, dwCount);
        checks.connection = AdviseConnection(dwConnection, true);
        checks.allOrNothing = true;
        return QueueRequest(dwCount, phServer, checks, pTransactionID, ppErrors,
                            WriteTransaction<CWriteTransaction>(dwConnection, phServer, pItemValues));
    });
}

STDMETHODIMP COPCGroup::Refresh(DWORD dwConnection, OPCDATASOURCE dwSource, DWORD *pTransactionID)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        return QueueRefresh(dwSource, AdviseConnection(dwConnection, false), pTransactionID, [&](DWORD id) {
            return std::make_unique<CRefreshTransaction>(id, this, dwConnection, dwSource);
        });
    });
}

STDMETHODIMP COPCGroup::Cancel(DWORD dwTransactionID)
{
    return Cancel2(dwTransactionID); // the same cancel for both versions
}

// ---- IDataObject -----------------------------------------------------

STDMETHODIMP COPCGroup::DAdvise(FORMATETC *pformatetc, DWORD advf, IAdviseSink *pAdvSink, DWORD *pdwConnection)
{
    return GroupBoundary([&]() -> HRESULT {
        // Null pointers are refused rather than followed.
        if (!pformatetc || !pAdvSink || !IsWritableOut(pdwConnection))
            return E_INVALIDARG;
        CSingleLock lock(&m_lock);
        // A target device's size must cover at least its own header.
        const DVTARGETDEVICE *device = pformatetc->ptd;
        if (device && (!IsReadable(device, sizeof(DWORD)) || device->tdSize < sizeof(DVTARGETDEVICE) ||
                       !IsReadable(device, device->tdSize)))
            return DV_E_DVTARGETDEVICE;
        CLIPFORMAT cf = pformatetc->cfFormat;
        CAdvisoryConnectionMgr *manager = cf == OpcStreams::DataTime()        ? &m_dataTimeAdvise
                                          : cf == OpcStreams::Data()          ? &m_dataAdvise
                                          : cf == OpcStreams::WriteComplete() ? &m_writeAdvise
                                                                              : nullptr;
        if (!manager)
            return DV_E_FORMATETC;
        HRESULT hr = manager->Add(*pformatetc, advf, pAdvSink, pdwConnection);
        // The current values, at once, on this thread; the sink is called
        // after the group lock is released.
        if (SUCCEEDED(hr) && manager != &m_writeAdvise && m_active)
            ReadAndSend(lock, *pdwConnection, 0, OPC_DS_CACHE, ActiveHandles());
        return hr;
    });
}

STDMETHODIMP COPCGroup::DUnadvise(DWORD dwConnection)
{
    return GroupBoundary([&]() -> HRESULT {
        // Each list has a lock of its own; the group lock is not taken, so
        // that the client's sink is released with no lock of the group held.
        for (CAdvisoryConnectionMgr *manager : {&m_dataTimeAdvise, &m_dataAdvise, &m_writeAdvise})
            if (manager->Remove(dwConnection) == S_OK)
                return S_OK;
        return E_FAIL;
    });
}

STDMETHODIMP COPCGroup::QueryGetData(FORMATETC *f)
{
    return GroupBoundary([&]() -> HRESULT {
        if (!f)
            return DV_E_FORMATETC;
        CLIPFORMAT cf = f->cfFormat;
        if (cf != OpcStreams::Data() && cf != OpcStreams::DataTime() && cf != OpcStreams::WriteComplete())
            return DV_E_FORMATETC;
        if (f->dwAspect != DVASPECT_CONTENT || f->ptd || f->tymed != TYMED_HGLOBAL)
            return DV_E_FORMATETC;
        return f->lindex == -1 ? S_OK : DV_E_LINDEX;
    });
}
