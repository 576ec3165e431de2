#include "OPCGroup.h"

#include "AsyncIOMgr.h"
#include "ComPtr.h"
#include "ComUtil.h"
#include "Delivery.h"
#include "IdMgr.h"
#include "OpcErrors.h"
#include "TaskMem.h"
#include "Trace.h"
#include "UpdateScanMgr.h"

#include <algorithm>
#include <cmath>
#include <utility>

namespace {
constexpr DWORD kMinUpdateRate = 10;

bool ValidDeadband(FLOAT value)
{
    // Written so that NaN fails both comparisons.
    return value >= 0.0f && value <= 100.0f;
}
} // namespace

COPCGroup *COPCGroup::Create()
{
    COPCGroup *group = NewComObject<COPCGroup>();
    if (group && group->m_serverHandle == 0) {
        // No identifier left in the whole number space: refuse the group
        // rather than hand out the invalid handle 0.
        DiscardComObject(group);
        return nullptr;
    }
    return group;
}

COPCGroup::COPCGroup()
{
    m_serverHandle = CIdMgr::Instance().GetId();
}

COPCGroup::~COPCGroup() = default;

void *COPCGroup::FindInterface(REFIID riid)
{
    if (IsEqualIID(riid, IID_IOPCGroupStateMgt))
        return static_cast<IOPCGroupStateMgt *>(this);
    if (IsEqualIID(riid, IID_IOPCSyncIO))
        return static_cast<IOPCSyncIO *>(this);
    if (IsEqualIID(riid, IID_IOPCAsyncIO))
        return static_cast<IOPCAsyncIO *>(this);
    if (IsEqualIID(riid, IID_IOPCItemMgt))
        return static_cast<IOPCItemMgt *>(this);
    if (IsEqualIID(riid, IID_IOPCAsyncIO2))
        return static_cast<IOPCAsyncIO2 *>(this);
    if (IsEqualIID(riid, IID_IDataObject))
        return static_cast<IDataObject *>(this);
    if (IsEqualIID(riid, IID_IConnectionPointContainer))
        return static_cast<IConnectionPointContainer *>(this);
    return nullptr;
}

void COPCGroup::FinalRelease()
{
    Destroy();
}

void COPCGroup::SetOwner(CGroupOwner *owner)
{
    CSingleLock lock(&m_lock);
    m_owner = owner;
}

std::wstring COPCGroup::Name()
{
    CSingleLock lock(&m_lock);
    return m_name;
}

COPCGroup::GroupCall::GroupCall(COPCGroup &group) : m_group(group), m_caller(LogicalCaller::Current())
{
    m_entered = m_group.m_activity.EnterCall(m_caller);
}

COPCGroup::GroupCall::~GroupCall()
{
    if (m_entered)
        m_group.m_activity.LeaveCall(m_caller);
}

COPCGroup::CallbackInFlight::CallbackInFlight(COPCGroup &group)
    : m_group(group), m_caller(LogicalCaller::Current()), m_kind(m_group.m_activity.BeginCallback(m_caller))
{
    CallbacksInFlight::Enter(m_caller);
}

COPCGroup::CallbackInFlight::~CallbackInFlight()
{
    CallbacksInFlight::Leave(m_caller);
    m_group.m_activity.EndCallback(m_caller, m_kind);
}

void COPCGroup::AddWork()
{
    InnerUnknown()->AddRef();
    m_activity.AddWork();
}

void COPCGroup::ReleaseWork()
{
    // While a removal waits, the unit's reference goes to the removal, so
    // that the removal sees the client's references alone; otherwise it is
    // released after the unit, as it may be the last.
    if (!m_activity.ReleaseWork())
        InnerUnknown()->Release();
}

void COPCGroup::BeginRemoval()
{
    const LogicalCaller self = LogicalCaller::Current();
    {
        CSingleLock lock(&m_lock);
        m_activity.MarkRemoving();
        m_callback.Close();
        SetActive(FALSE); // its queued scan goes
    }
    // Its queued transactions go unexecuted, as cancelled ones do; they are
    // destroyed here, outside the group lock.
    if (CAsyncIOMgr *manager = CAsyncIOMgr::Instance())
        manager->RemoveAllOf(this);
    LONG handedOver = m_activity.WaitForRemoval(self);
    {
        // A scan still inside a callback must not reach an owner that may
        // be gone when it returns.
        CSingleLock lock(&m_lock);
        m_owner = nullptr;
    }
    // Never the last: the caller holds the server's reference.
    for (; handedOver > 0; --handedOver)
        InnerUnknown()->Release();
}

void COPCGroup::Destroy()
{
    CSingleLock lock(&m_lock);
    if (m_destroyed)
        return;
    m_destroyed = true;
    m_activity.MarkRemoving();
    m_callback.Close();
    m_items.Clear(); // each item leaves the active list and ends its subscription
    if (m_serverHandle != 0)
        CIdMgr::Instance().ReleaseId(m_serverHandle);
    m_owner = nullptr;
    lock.Unlock();
    // The clients' sinks are released without the group lock.
    m_callback.Clear();
    m_dataAdvise.RemoveAll();
    m_dataTimeAdvise.RemoveAll();
    m_writeAdvise.RemoveAll();
}

void COPCGroup::SetActive(BOOL active)
{
    CSingleLock lock(&m_lock);
    m_failedScans = 0;
    active = active ? TRUE : FALSE;
    if (m_active == active)
        return;
    m_active = active;
    CUpdateScanMgr *scanner = CUpdateScanMgr::Instance();
    if (!active) {
        // A queued entry goes now; one in flight is dropped by the scanner.
        if (scanner && scanner->Unschedule(this))
            ReleaseWork(); // never the last reference: the caller holds one
        m_items.ForEach([](COPCItem &item) { item.SetOutOfService(); });
    } else if (scanner) {
        AddWork();
        scanner->Schedule(this, 0, true); // scanned at once
    }
}

STDMETHODIMP COPCGroup::GetState(DWORD *pUpdateRate, BOOL *pActive, LPWSTR *ppName, LONG *pTimeBias,
                                 FLOAT *pPercentDeadband, DWORD *pLCID, OPCHANDLE *phClientGroup,
                                 OPCHANDLE *phServerGroup)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(pUpdateRate) || !IsWritableOut(pActive) || !IsWritableOut(ppName) ||
            !IsWritableOut(pTimeBias) || !IsWritableOut(pPercentDeadband) || !IsWritableOut(pLCID) ||
            !IsWritableOut(phClientGroup) || !IsWritableOut(phServerGroup))
            return E_INVALIDARG;
        *pUpdateRate = m_updateRate;
        *pActive = m_active;
        *pTimeBias = m_timeBias;
        *pPercentDeadband = m_percentDeadband;
        *pLCID = m_lcid;
        *phClientGroup = m_clientHandle;
        *phServerGroup = m_serverHandle;
        *ppName = TaskStrDup(m_name.c_str());
        return *ppName ? S_OK : E_OUTOFMEMORY;
    });
}

STDMETHODIMP COPCGroup::SetState(DWORD *pRequestedUpdateRate, DWORD *pRevisedUpdateRate, BOOL *pActive, LONG *pTimeBias,
                                 FLOAT *pPercentDeadband, DWORD *pLCID, OPCHANDLE *phClientGroup)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(pRevisedUpdateRate))
            return E_INVALIDARG;
        if (pPercentDeadband && !ValidDeadband(*pPercentDeadband))
            return E_INVALIDARG;
        m_percentDeadband = pPercentDeadband ? *pPercentDeadband : 0.0f;
        m_deadbandFraction = m_percentDeadband / 100.0;

        HRESULT result = S_OK;
        if (pRequestedUpdateRate) {
            DWORD oldRate = m_updateRate;
            m_updateRate = *pRequestedUpdateRate;
            if (m_updateRate < kMinUpdateRate) {
                m_updateRate = kMinUpdateRate;
                result = OPC_S_UNSUPPORTEDRATE;
            }
            if (m_active && m_updateRate != oldRate)
                if (CUpdateScanMgr *scanner = CUpdateScanMgr::Instance())
                    scanner->ShiftDue(this, oldRate, m_updateRate);
            *pRevisedUpdateRate = m_updateRate;
        }
        if (pTimeBias)
            m_timeBias = *pTimeBias;
        if (pLCID)
            m_lcid = *pLCID;
        if (phClientGroup)
            m_clientHandle = *phClientGroup;
        if (pActive)
            SetActive(*pActive);
        return result;
    });
}

STDMETHODIMP COPCGroup::SetName(LPCWSTR szName)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!m_owner)
            return E_FAIL;
        CGroupRegistry &registry = m_owner->Registry();
        std::wstring name;
        if (!szName) {
            wchar_t generated[kDefaultGroupNameChars];
            name = MakeDefaultGroupName(generated);
        } else {
            name = szName;
            if (name.empty())
                return E_INVALIDARG;
            if (registry.FindName(name))
                return OPC_E_DUPLICATENAME;
        }
        if (!m_name.empty() && registry.EraseName(m_name) != 1) {
            INTERNAL_ASSERT_FAILED("group name missing from the name index");
            return E_FAIL;
        }
        if (!registry.InsertName(name, this)) {
            // Two concurrent renames to one name, or a generated name that a
            // client had already taken.
            INTERNAL_ASSERT_FAILED("group name already in the name index");
            m_name.clear();
            return E_FAIL;
        }
        m_name = std::move(name);
        return S_OK;
    });
}

STDMETHODIMP COPCGroup::CloneGroup(LPCWSTR szName, REFIID riid, LPUNKNOWN *ppUnk)
{
    return GroupBoundary([&]() -> HRESULT {
        // The copy of the state is taken under the group lock, which is then
        // released: AddGroup and RemoveGroup take the server lock, which
        // comes before any group lock. The owner is entered while the group
        // lock still holds off its destruction.
        CGroupOwner *owner;
        DWORD rate;
        OPCHANDLE clientHandle;
        LONG timeBias;
        FLOAT deadband;
        LCID lcid;
        {
            CSingleLock lock(&m_lock);
            if (!IsWritableOut(ppUnk))
                return E_INVALIDARG;
            *ppUnk = nullptr;
            if (!m_owner || !m_owner->EnterGroupCall())
                return E_FAIL;
            owner = m_owner;
            rate = m_updateRate;
            clientHandle = m_clientHandle;
            timeBias = m_timeBias;
            deadband = m_percentDeadband;
            lcid = m_lcid;
        }

        struct Leave {
            CGroupOwner *owner;
            ~Leave() { owner->LeaveGroupCall(); }
        } leave{owner};
        IOPCServer *server = owner->OwnerServer();
        OPCHANDLE newHandle = 0;
        DWORD revisedRate = 0;
        ComPtr<IOPCItemMgt> itemMgt;
        HRESULT hr = server->AddGroup(szName, FALSE, rate, clientHandle, &timeBias, &deadband, lcid, &newHandle,
                                      &revisedRate, IID_IOPCItemMgt, reinterpret_cast<IUnknown **>(itemMgt.Out()));
        if (hr != S_OK)
            return hr;
        hr = itemMgt->QueryInterface(riid, reinterpret_cast<void **>(ppUnk));
        if (FAILED(hr)) {
            *ppUnk = nullptr;
            itemMgt.Reset();
            server->RemoveGroup(newHandle, TRUE);
            return hr;
        }
        hr = CopyItems(itemMgt.Get());
        if (FAILED(hr)) {
            (*ppUnk)->Release();
            *ppUnk = nullptr;
            itemMgt.Reset();
            server->RemoveGroup(newHandle, TRUE);
        }
        return hr;
    });
}
