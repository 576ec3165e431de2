#pragma once
// The OPC server object that clients create: it owns their groups, indexes
// them by name and by server handle, and reports the server status.
#include "ComObject.h"
#include "GroupOwner.h"
#include "GroupRegistry.h"
#include "OPCGroup.h"
#include "SingleSinkPoint.h"
#include "SyncObject.h"
#include "opccomn.h"
#include "opcda.h"

#include <string>

class CAsyncIOMgr;
class CUpdateScanMgr;

class COPCServer : public CComObjectRoot,
                   public IOPCServer,
                   public IOPCCommon,
                   public IOPCItemProperties,
                   public IConnectionPointContainer,
                   private CGroupOwner {
public:
    // A server object bound to outer (aggregated) or plain; no references yet.
    static COPCServer *Create(IUnknown *outer);

    // Starts the shared services and takes the two singleton references.
    HRESULT FinalConstruct();

    DECLARE_COM_UNKNOWN()

    // IOPCServer
    STDMETHODIMP AddGroup(LPCWSTR szName, BOOL bActive, DWORD dwRequestedUpdateRate, OPCHANDLE hClientGroup,
                          LONG *pTimeBias, FLOAT *pPercentDeadband, DWORD dwLCID, OPCHANDLE *phServerGroup,
                          DWORD *pRevisedUpdateRate, REFIID riid, LPUNKNOWN *ppUnk) override;
    STDMETHODIMP GetErrorString(HRESULT dwError, LCID dwLocale, LPWSTR *ppString) override;
    STDMETHODIMP GetGroupByName(LPCWSTR szName, REFIID riid, LPUNKNOWN *ppUnk) override;
    STDMETHODIMP GetStatus(OPCSERVERSTATUS **ppServerStatus) override;
    STDMETHODIMP RemoveGroup(OPCHANDLE hServerGroup, BOOL bForce) override;
    STDMETHODIMP CreateGroupEnumerator(OPCENUMSCOPE dwScope, REFIID riid, LPUNKNOWN *ppUnk) override;

    // IOPCCommon
    STDMETHODIMP SetLocaleID(LCID dwLcid) override;
    STDMETHODIMP GetLocaleID(LCID *pdwLcid) override;
    STDMETHODIMP QueryAvailableLocaleIDs(DWORD *pdwCount, LCID **pdwLcid) override;
    STDMETHODIMP GetErrorString(HRESULT dwError, LPWSTR *ppString) override;
    STDMETHODIMP SetClientName(LPCWSTR szName) override;

    // IOPCItemProperties
    STDMETHODIMP QueryAvailableProperties(LPWSTR szItemID, DWORD *pdwCount, DWORD **ppPropertyIDs,
                                          LPWSTR **ppDescriptions, VARTYPE **ppvtDataTypes) override;
    STDMETHODIMP GetItemProperties(LPWSTR szItemID, DWORD dwCount, DWORD *pdwPropertyIDs, VARIANT **ppvData,
                                   HRESULT **ppErrors) override;
    STDMETHODIMP LookupItemIDs(LPWSTR szItemID, DWORD dwCount, DWORD *pdwPropertyIDs, LPWSTR **ppszNewItemIDs,
                               HRESULT **ppErrors) override;

    // IConnectionPointContainer: one point, for IOPCShutdown.
    STDMETHODIMP EnumConnectionPoints(IEnumConnectionPoints **ppEnum) override;
    STDMETHODIMP FindConnectionPoint(REFIID riid, IConnectionPoint **ppCP) override;

protected:
    void *FindInterface(REFIID riid) override;
    HRESULT CreateOnQuery(REFIID riid, void **ppv) override;
    void FinalRelease() override;

private:
    HRESULT PropertyDeviceRead(const wchar_t *itemId, COPCGroup::PropertyRead &out);

    static constexpr DWORD kShutdownCookie = 0x5D;

    // CGroupOwner
    IOPCServer *OwnerServer() override { return this; }
    CGroupRegistry &Registry() override { return m_registry; }
    bool EnterGroupCall() override;
    void LeaveGroupCall() override;
    // Called by a scan that delivered a data change. The time has a lock of
    // its own: a scan must never wait for the server lock, which RemoveGroup
    // holds while it waits for that very group to be idle.
    void SetLastUpdateTime(const FILETIME &time) override;

    template <class T, class... Args> friend T *NewComObject(Args &&...args);
    explicit COPCServer(IUnknown *outer) : CComObjectRoot(outer) {}
    ~COPCServer() override = default;

    HRESULT AddGroupLocked(LPCWSTR szName, BOOL bActive, DWORD dwRequestedUpdateRate, OPCHANDLE hClientGroup,
                           LONG *pTimeBias, FLOAT *pPercentDeadband, DWORD dwLCID, OPCHANDLE *phServerGroup,
                           DWORD *pRevisedUpdateRate, REFIID riid, LPUNKNOWN *ppUnk);
    void UndoAddGroup(COPCGroup *group, LPUNKNOWN *ppUnk);
    // Removal of a group already taken out of the registry, whose server
    // reference the caller now holds.
    HRESULT RemoveUnregisteredGroup(COPCGroup *group, BOOL force);
    HRESULT EnumerateGroups(REFIID riid, LPUNKNOWN *ppUnk);

    CUpdateScanMgr *m_scanMgr = nullptr;
    CAsyncIOMgr *m_asyncMgr = nullptr;
    CCriticalSection m_lock{LockOrder::Server};
    FILETIME m_startTime = {};
    CCriticalSection m_updateTimeLock{LockOrder::Leaf};
    FILETIME m_lastUpdateTime = {};
    DWORD m_groupCount = 0;
    CGroupRegistry m_registry;
    volatile LCID m_locale = LOCALE_SYSTEM_DEFAULT;
    // The one IOPCShutdown sink; the server never calls it.
    CSinkSlot m_shutdownSink{IID_IOPCShutdown, kShutdownCookie, InnerUnknown()};
    std::wstring m_clientName;
    bool m_counted = false; // counted among the server objects of the process
    // Calls from groups into this object; innermost lock.
    CCriticalSection m_groupCallLock{LockOrder::Leaf};
    LONG m_groupCalls = 0;
    bool m_closing = false; // final release has begun: AddGroup refuses
};
