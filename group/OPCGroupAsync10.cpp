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

HRESULT COPCGroup::NotifyAdviseSinks(DWORD count, const OPCHANDLE *clients, const VARIANT *values,
                                     const WORD *qualities, const FILETIME *times)
{
    CSingleLock lock(&m_lock);
    bool any = false, sent = false;
    for (bool withTime : {true, false}) {
        CAdvisoryConnectionMgr &manager = withTime ? m_dataTimeAdvise : m_dataAdvise;
        if (manager.Count() == 0)
            continue;
        any = true;
        HGLOBAL memory = nullptr;
        HRESULT hr =
            OpcStreams::BuildData(withTime, m_clientHandle, 0, count, clients, values, qualities, times, &memory);
        if (FAILED(hr)) {
            INTERNAL_ASSERT_FAILED("building a data stream");
            return withTime ? hr : E_FAIL;
        }
        sent |= SendStream(memory, [&](STGMEDIUM &m) { return manager.SendToAll(m); }) == S_OK;
    }
    return !any ? S_FALSE : sent ? S_OK : E_FAIL;
}

HRESULT COPCGroup::SendReadComplete(DWORD connection, DWORD id, HRESULT overall, DWORD count, const OPCHANDLE *clients,
                                    const VARIANT *values, const WORD *qualities, const FILETIME *times)
{
    CSingleLock lock(&m_lock);
    bool withTime = m_dataTimeAdvise.Contains(connection);
    if (!withTime && !m_dataAdvise.Contains(connection))
        return OLE_E_NOCONNECTION; // unadvised meanwhile
    CAdvisoryConnectionMgr &manager = withTime ? m_dataTimeAdvise : m_dataAdvise;
    HGLOBAL memory = nullptr;
    HRESULT hr = OpcStreams::BuildData(withTime, m_clientHandle, id, FAILED(overall) ? 0 : count, clients, values,
                                       qualities, times, &memory);
    if (FAILED(hr))
        return hr;
    return SendStream(memory, [&](STGMEDIUM &m) { return manager.SendTo(connection, m); });
}

HRESULT COPCGroup::SendWriteComplete(DWORD connection, DWORD id, HRESULT overall, DWORD count, const OPCHANDLE *clients,
                                     const HRESULT *errors)
{
    CSingleLock lock(&m_lock);
    if (!m_writeAdvise.Contains(connection))
        return OLE_E_NOCONNECTION;
    HGLOBAL memory = nullptr;
    HRESULT hr =
        OpcStreams::BuildWriteComplete(m_clientHandle, id, FAILED(overall) ? 0 : count, clients, errors, &memory);
    if (FAILED(hr))
        return hr;
    return SendStream(memory, [&](STGMEDIUM &m) { return m_writeAdvise.SendTo(connection, m); });
}

// ---- Transaction work ------------------------------------------------

HRESULT COPCGroup::ExecuteRead(DWORD connection, DWORD id, OPCDATASOURCE source, const std::vector<OPCHANDLE> &handles)
{
    CSingleLock lock(&m_lock);
    std::vector<ReadResult> results;
    HRESULT overall = ReadPass(source, static_cast<DWORD>(handles.size()), handles.data(), results);
    Delivery d(std::move(results));
    return SendReadComplete(connection, id, overall, d.Count(), d.clients.data(), d.values.data(), d.qualities.data(),
                            d.times.data());
}

HRESULT COPCGroup::ExecuteWrite(DWORD connection, DWORD id, const std::vector<OPCHANDLE> &handles,
                                const std::vector<VARIANT> &values)
{
    CSingleLock lock(&m_lock);
    WriteResults w(handles.size());
    WritePass(handles, values, w);
    return SendWriteComplete(connection, id, w.overall, w.Count(), w.clients.data(), w.errors.data());
}

HRESULT COPCGroup::ExecuteRefresh(DWORD connection, DWORD id, OPCDATASOURCE source)
{
    CSingleLock lock(&m_lock);
    if (!m_active)
        return S_OK; // nothing is sent for an inactive group
    return ExecuteRead(connection, id, source, ActiveHandles());
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
    return ComBoundary([&]() -> HRESULT {
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
    return ComBoundary([&]() -> HRESULT {
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
    return ComBoundary([&]() -> HRESULT {
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
    return ComBoundary([&]() -> HRESULT {
        // Null pointers are refused rather than followed.
        if (!pformatetc || !pAdvSink || !IsWritableOut(pdwConnection))
            return E_INVALIDARG;
        CSingleLock lock(&m_lock);
        if (m_removing)
            return E_FAIL;
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
        if (SUCCEEDED(hr) && manager != &m_writeAdvise)
            ExecuteRefresh(*pdwConnection, 0, OPC_DS_CACHE); // the current values, at once
        return hr;
    });
}

STDMETHODIMP COPCGroup::DUnadvise(DWORD dwConnection)
{
    CSingleLock lock(&m_lock);
    for (CAdvisoryConnectionMgr *manager : {&m_dataTimeAdvise, &m_dataAdvise, &m_writeAdvise})
        if (manager->Remove(dwConnection) == S_OK)
            return S_OK;
    return E_FAIL;
}

STDMETHODIMP COPCGroup::QueryGetData(FORMATETC *f)
{
    if (!f)
        return DV_E_FORMATETC;
    CLIPFORMAT cf = f->cfFormat;
    if (cf != OpcStreams::Data() && cf != OpcStreams::DataTime() && cf != OpcStreams::WriteComplete())
        return DV_E_FORMATETC;
    if (f->dwAspect != DVASPECT_CONTENT || f->ptd || f->tymed != TYMED_HGLOBAL)
        return DV_E_FORMATETC;
    return f->lindex == -1 ? S_OK : DV_E_LINDEX;
}
