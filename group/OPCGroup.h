#pragma once
// The OPC group: its state, its items and the interfaces a client uses on it.
// Created only by the server object's AddGroup (and for item properties).
#include "AdvisoryConnectionMgr.h"
#include "ComObject.h"
#include "ComPtr.h"
#include "ComUtil.h"
#include "GroupActivity.h"
#include "GroupOwner.h"
#include "GroupRegistry.h"
#include "Handle.h"
#include "ItemOwner.h"
#include "ItemTable.h"
#include "OPCItem.h"
#include "SingleSinkPoint.h"
#include "SyncObject.h"
#include "TaskMem.h"
#include "opcda.h"

#include <atomic>
#include <functional>
#include <memory>
#include <ocidl.h>
#include <string>
#include <vector>

struct Delivery;

struct ItemAttributesSnapshot;

class COPCGroup : public CComObjectRoot,
                  public IOPCGroupStateMgt,
                  public IOPCSyncIO,
                  public IOPCAsyncIO,
                  public IOPCItemMgt,
                  public IOPCAsyncIO2,
                  public IDataObject,
                  public IConnectionPointContainer,
                  private CItemOwner {
public:
    // A group with a fresh server handle and no references; null when out of
    // memory or when no identifier is left.
    static COPCGroup *Create();

    DECLARE_COM_UNKNOWN()

    // IOPCGroupStateMgt
    STDMETHODIMP GetState(DWORD *pUpdateRate, BOOL *pActive, LPWSTR *ppName, LONG *pTimeBias, FLOAT *pPercentDeadband,
                          DWORD *pLCID, OPCHANDLE *phClientGroup, OPCHANDLE *phServerGroup) override;
    STDMETHODIMP SetState(DWORD *pRequestedUpdateRate, DWORD *pRevisedUpdateRate, BOOL *pActive, LONG *pTimeBias,
                          FLOAT *pPercentDeadband, DWORD *pLCID, OPCHANDLE *phClientGroup) override;
    STDMETHODIMP SetName(LPCWSTR szName) override;
    STDMETHODIMP CloneGroup(LPCWSTR szName, REFIID riid, LPUNKNOWN *ppUnk) override;

    // IOPCSyncIO
    STDMETHODIMP Read(OPCDATASOURCE dwSource, DWORD dwCount, OPCHANDLE *phServer, OPCITEMSTATE **ppItemValues,
                      HRESULT **ppErrors) override;
    STDMETHODIMP Write(DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues, HRESULT **ppErrors) override;

    // IOPCAsyncIO (DA 1.0)
    STDMETHODIMP Read(DWORD dwConnection, OPCDATASOURCE dwSource, DWORD dwCount, OPCHANDLE *phServer,
                      DWORD *pTransactionID, HRESULT **ppErrors) override;
    STDMETHODIMP Write(DWORD dwConnection, DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues,
                       DWORD *pTransactionID, HRESULT **ppErrors) override;
    STDMETHODIMP Refresh(DWORD dwConnection, OPCDATASOURCE dwSource, DWORD *pTransactionID) override;
    STDMETHODIMP Cancel(DWORD dwTransactionID) override;

    // IDataObject
    STDMETHODIMP GetData(FORMATETC *, STGMEDIUM *) override { return E_NOTIMPL; }
    STDMETHODIMP GetDataHere(FORMATETC *, STGMEDIUM *) override { return E_NOTIMPL; }
    STDMETHODIMP QueryGetData(FORMATETC *pformatetc) override;
    STDMETHODIMP GetCanonicalFormatEtc(FORMATETC *, FORMATETC *) override { return E_NOTIMPL; }
    STDMETHODIMP SetData(FORMATETC *, STGMEDIUM *, BOOL) override { return E_NOTIMPL; }
    STDMETHODIMP EnumFormatEtc(DWORD, IEnumFORMATETC **) override { return E_NOTIMPL; }
    STDMETHODIMP DAdvise(FORMATETC *pformatetc, DWORD advf, IAdviseSink *pAdvSink, DWORD *pdwConnection) override;
    STDMETHODIMP DUnadvise(DWORD dwConnection) override;
    STDMETHODIMP EnumDAdvise(IEnumSTATDATA **) override { return E_NOTIMPL; }

    // IOPCAsyncIO2
    STDMETHODIMP Read(DWORD dwCount, OPCHANDLE *phServer, DWORD dwTransactionID, DWORD *pdwCancelID,
                      HRESULT **ppErrors) override;
    STDMETHODIMP Write(DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues, DWORD dwTransactionID,
                       DWORD *pdwCancelID, HRESULT **ppErrors) override;
    STDMETHODIMP Refresh2(OPCDATASOURCE dwSource, DWORD dwTransactionID, DWORD *pdwCancelID) override;
    STDMETHODIMP Cancel2(DWORD dwCancelID) override;
    STDMETHODIMP SetEnable(BOOL bEnable) override;
    STDMETHODIMP GetEnable(BOOL *pbEnable) override;

    // IConnectionPointContainer
    STDMETHODIMP EnumConnectionPoints(IEnumConnectionPoints **ppEnum) override;
    STDMETHODIMP FindConnectionPoint(REFIID riid, IConnectionPoint **ppCP) override;

    // The data-callback sink's fixed cookie.
    static constexpr DWORD kCallbackCookie = 0xDA7A;

    // Work of the transactions, on the worker thread.
    HRESULT ExecuteRead2(DWORD clientId, const std::vector<OPCHANDLE> &handles);
    HRESULT ExecuteWrite2(DWORD clientId, const std::vector<OPCHANDLE> &handles, const std::vector<VARIANT> &values);
    HRESULT ExecuteRefresh2(DWORD clientId, OPCDATASOURCE source);
    HRESULT ExecuteRead(DWORD connection, DWORD id, OPCDATASOURCE source, const std::vector<OPCHANDLE> &handles);
    HRESULT ExecuteWrite(DWORD connection, DWORD id, const std::vector<OPCHANDLE> &handles,
                         const std::vector<VARIANT> &values);
    HRESULT ExecuteRefresh(DWORD connection, DWORD id, OPCDATASOURCE source);

    // The DA 1.0 senders: called with the group lock held in lock, they
    // build the stream under it and release it before the sinks are called.
    HRESULT NotifyAdviseSinks(CSingleLock &lock, DWORD count, const OPCHANDLE *clients, const VARIANT *values,
                              const WORD *qualities, const FILETIME *times);
    HRESULT SendReadComplete(CSingleLock &lock, DWORD connection, DWORD id, HRESULT overall, DWORD count,
                             const OPCHANDLE *clients, const VARIANT *values, const WORD *qualities,
                             const FILETIME *times);
    HRESULT SendWriteComplete(CSingleLock &lock, DWORD connection, DWORD id, HRESULT overall, DWORD count,
                              const OPCHANDLE *clients, const HRESULT *errors);

    // The update scan (scanner thread): delivers the changed active items;
    // next receives the next due time. FALSE when the group is inactive or
    // delivery failed. columns: the scanning thread's own, lent for the
    // scan and given back with their values emptied.
    BOOL Scan(LONGLONG &next, Delivery &columns);
    void SetFailedScans(DWORD count);
    DWORD IncrementFailedScans();
    // A scanner entry or a transaction takes a work unit and a reference to
    // the group, and lets go of both. While a removal waits, the reference goes to the removal, so that the
    // removal sees the client's references alone.
    void AddWork();
    void ReleaseWork();

    // IOPCItemMgt
    STDMETHODIMP AddItems(DWORD dwCount, OPCITEMDEF *pItemArray, OPCITEMRESULT **ppAddResults,
                          HRESULT **ppErrors) override;
    STDMETHODIMP ValidateItems(DWORD dwCount, OPCITEMDEF *pItemArray, BOOL bBlobUpdate,
                               OPCITEMRESULT **ppValidationResults, HRESULT **ppErrors) override;
    STDMETHODIMP RemoveItems(DWORD dwCount, OPCHANDLE *phServer, HRESULT **ppErrors) override;
    STDMETHODIMP SetActiveState(DWORD dwCount, OPCHANDLE *phServer, BOOL bActive, HRESULT **ppErrors) override;
    STDMETHODIMP SetClientHandles(DWORD dwCount, OPCHANDLE *phServer, OPCHANDLE *phClient, HRESULT **ppErrors) override;
    STDMETHODIMP SetDatatypes(DWORD dwCount, OPCHANDLE *phServer, VARTYPE *pRequestedDatatypes,
                              HRESULT **ppErrors) override;
    STDMETHODIMP CreateEnumerator(REFIID riid, LPUNKNOWN *ppUnk) override;

    // Set by AddGroup: the owning server object (not referenced; the link is
    // cut by the removal, which the server's release makes of every group it
    // still holds, and at destruction).
    void SetOwner(CGroupOwner *owner);
    OPCHANDLE ServerHandle() const { return m_serverHandle; }
    std::wstring Name();

    // The read and write passes of synchronous I/O, also run by the
    // asynchronous transactions. Per item: client handle, value, quality,
    // time stamp and result; S_FALSE when any item failed. Call with the
    // group lock held.
    struct ReadResult {
        OPCHANDLE client = 0xFFFFFFFF;
        VARIANT value;
        WORD quality = 0;
        FILETIME time = {};
        HRESULT error = S_OK;
    };
    HRESULT ReadPass(OPCDATASOURCE source, DWORD count, const OPCHANDLE *handles, std::vector<ReadResult> &results);
    HRESULT WritePass(DWORD count, const OPCHANDLE *handles, const VARIANT *values, HRESULT *errors,
                      OPCHANDLE *clientHandles = nullptr);
    // The write pass of the asynchronous writes, into columns for their completions.
    struct WriteResults {
        explicit WriteResults(size_t n) : errors(n), clients(n, 0xFFFFFFFF) {}
        std::vector<HRESULT> errors;
        std::vector<OPCHANDLE> clients;
        HRESULT overall = S_OK;
        DWORD Count() const { return static_cast<DWORD>(errors.size()); }
    };
    void WritePass(const std::vector<OPCHANDLE> &handles, const std::vector<VARIANT> &values, WriteResults &out);

    // The one-off device read of the item properties, in a temporary group
    // made for it: the item is made, read from the device (waiting for a
    // first value) and left for the group's destruction.
    struct PropertyRead {
        CVariant value;
        WORD quality = 0;
        FILETIME time = {};
        VARTYPE canonical = VT_EMPTY;
        DWORD rights = 0;
    };
    HRESULT ReadForProperties(const wchar_t *itemId, PropertyRead &out);

    // Removal: sets the removing flag (every call on the group fails from
    // then on), makes the group inactive, drops its queued transactions,
    // waits for the calls, scans and transactions in flight that it may wait
    // for (GroupActivity.h), and cuts the link to the owner. It holds no
    // lock while it waits.
    void BeginRemoval();
    // Destroys the items and gives the handle back; later calls fail with
    // E_FAIL. Runs once, at forced removal or at the last release.
    void Destroy();
    void SetActive(BOOL active);

protected:
    void *FindInterface(REFIID riid) override;
    void FinalRelease() override;

private:
    // CItemOwner
    CSyncObject &GroupLock() override { return m_lock; }
    CActiveItemList &ActiveItems() override { return m_activeItems; }
    bool GroupActive() const override { return m_active != FALSE; }

    COPCItem *FindItem(OPCHANDLE handle);
    // The one way into the group for a client's call: every method's body
    // runs in it, inside the COM boundary. E_FAIL once removal has begun;
    // otherwise the call counts as work in flight until it returns.
    template <class Body> HRESULT GroupBoundary(Body body)
    {
        return ComBoundary([&]() -> HRESULT {
            GroupCall call(*this);
            if (!call)
                return E_FAIL;
            return body();
        });
    }
    class GroupCall {
    public:
        explicit GroupCall(COPCGroup &group);
        ~GroupCall();
        GroupCall(const GroupCall &) = delete;
        GroupCall &operator=(const GroupCall &) = delete;
        explicit operator bool() const { return m_entered; }

    private:
        COPCGroup &m_group;
        const LogicalCaller m_caller;
        bool m_entered = false;
    };
    // A client callback in flight, from its start (group lock held) until
    // it returns.
    class CallbackInFlight {
    public:
        explicit CallbackInFlight(COPCGroup &group);
        ~CallbackInFlight();
        CallbackInFlight(const CallbackInFlight &) = delete;
        CallbackInFlight &operator=(const CallbackInFlight &) = delete;

    private:
        COPCGroup &m_group;
        const LogicalCaller m_caller;
        CGroupActivity::Kind m_kind;
    };
    // A built DA 1.0 stream and the connections it goes to.
    struct StreamSend {
        ConnectionList connections;
        HGLOBAL memory = nullptr;
    };
    // Sends each built stream and frees it; the lock (held on entry) is
    // released before the first sink is called.
    void SendStreams(CSingleLock &lock, StreamSend *sends, size_t count);
    // A DA 1.0 read of the handles and its completion to one connection.
    HRESULT ReadAndSend(CSingleLock &lock, DWORD connection, DWORD id, OPCDATASOURCE source,
                        const std::vector<OPCHANDLE> &handles);
    // Reads the handles and sends the results through one of the two
    // callbacks that carry values; the lock (held on entry) is released for
    // the call.
    using ReadCallback = HRESULT (STDMETHODCALLTYPE IOPCDataCallback::*)(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD,
                                                                         OPCHANDLE *, VARIANT *, WORD *, FILETIME *,
                                                                         HRESULT *);
    HRESULT SendReadResults(CSingleLock &lock, DWORD clientId, OPCDATASOURCE source,
                            const std::vector<OPCHANDLE> &handles, ReadCallback callback);
    // Reads the active items (list order) for a refresh.
    std::vector<OPCHANDLE> ActiveHandles();
    HRESULT QueueTransaction(std::unique_ptr<class CTransaction> t);
    // The asynchronous Read and Write of both versions: the checks in the
    // order of their error codes, the per-item errors, and a transaction of
    // the items that passed. Version 2.0 checks the access rights per item
    // and queues what passed; version 1.0 checks only that the items exist
    // (rights show in the completion) and queues only when all do.
    struct RequestChecks {
        bool argumentsValid = true; // the request's other array or its data source
        HRESULT connection = S_OK;  // the connection the completion goes through
        DWORD rights = 0;           // needed per item
        bool allOrNothing = false;
    };
    using MakeTransaction =
        std::function<HRESULT(DWORD id, const std::vector<DWORD> &passed, std::unique_ptr<class CTransaction> &made)>;
    HRESULT QueueRequest(DWORD count, const OPCHANDLE *handles, const RequestChecks &checks, DWORD *pId,
                         HRESULT **ppErrors, const MakeTransaction &make);
    // The transaction of a write of either version: the values of the items
    // that passed, copied.
    template <class Write>
    MakeTransaction WriteTransaction(DWORD request, const OPCHANDLE *handles, const VARIANT *values)
    {
        return [this, request, handles, values](DWORD id, const std::vector<DWORD> &passed,
                                                std::unique_ptr<class CTransaction> &made) {
            auto t = std::make_unique<Write>(id, this, request);
            HRESULT hr = t->Add(handles, values, passed);
            made = std::move(t);
            return hr;
        };
    }
    // Refresh and Refresh2: the same checks, on the active items.
    using MakeRefresh = std::function<std::unique_ptr<class CTransaction>(DWORD id)>;
    HRESULT QueueRefresh(OPCDATASOURCE source, HRESULT connection, DWORD *pId, const MakeRefresh &make);
    // S_OK, or CONNECT_E_NOCONNECTION without an IOPCDataCallback sink.
    HRESULT CallbackConnection();
    // S_OK, or OLE_E_NOCONNECTION when the DA 1.0 advise connection is not one
    // of the data formats (or, for a write, of the write-complete format).
    HRESULT AdviseConnection(DWORD connection, bool write);
    // The common frame of the per-item operations on existing items.
    template <class PerItem>
    HRESULT ForEachHandle(DWORD count, const OPCHANDLE *handles, HRESULT **ppErrors, PerItem perItem);
    // The checks and allocations that AddItems and ValidateItems share.
    HRESULT BeginItemDefinitions(DWORD count, const OPCITEMDEF *items, OPCITEMRESULT **ppResults, HRESULT **ppErrors,
                                 TaskMem<OPCITEMRESULT> &results, TaskMem<HRESULT> &errors);
    HRESULT AddItemsLocked(DWORD count, const OPCITEMDEF *items, OPCITEMRESULT *results, HRESULT *errors);
    HRESULT CopyItems(IOPCItemMgt *target);
    // Every item's attributes, in handle order; false when memory is short.
    bool TakeAttributes(ItemAttributesSnapshot &snapshot);

    template <class T, class... Args> friend T *NewComObject(Args &&...args);
    COPCGroup();
    ~COPCGroup() override;

    CCriticalSection m_lock{LockOrder::Group}; // guards every field below
    CGroupActivity m_activity;                 // client calls, callbacks and work in flight
    CGroupOwner *m_owner = nullptr;
    CItemTable m_items;
    CActiveItemList m_activeItems;
    CSinkSlot m_callback{IID_IOPCDataCallback, kCallbackCookie, InnerUnknown()}; // the one IOPCDataCallback sink
    CAdvisoryConnectionMgr m_dataAdvise;
    CAdvisoryConnectionMgr m_dataTimeAdvise;
    CAdvisoryConnectionMgr m_writeAdvise;
    DWORD m_failedScans = 0;
    bool m_destroyed = false;
    DWORD m_updateRate = 0;
    std::atomic<BOOL> m_active{FALSE}; // also read without the lock by items
    BOOL m_enable = TRUE;
    std::wstring m_name;
    LONG m_timeBias = 0;
    FLOAT m_percentDeadband = 0.0f;
    double m_deadbandFraction = 0.0;
    LCID m_lcid = 0;
    OPCHANDLE m_clientHandle = 0;
    OPCHANDLE m_serverHandle = 0;
};
