#include "OPCGroup.h"

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

bool COPCGroup::Caller::operator==(const Caller &o) const
{
    // Without a logical thread (COM refused it), the physical one decides.
    if (IsEqualGUID(logicalThread, GUID_NULL) || IsEqualGUID(o.logicalThread, GUID_NULL))
        return thread == o.thread;
    return IsEqualGUID(logicalThread, o.logicalThread) != FALSE;
}

COPCGroup::Caller COPCGroup::Caller::Current()
{
    // A call that a client makes from inside a callback carries the
    // callback's logical thread, also when it arrives on another thread.
    Caller c{GUID_NULL, GetCurrentThreadId()};
    if (FAILED(CoGetCurrentLogicalThreadId(&c.logicalThread)))
        c.logicalThread = GUID_NULL;
    return c;
}

LONG COPCGroup::CallbacksOf(const Caller &caller) const
{
    return static_cast<LONG>(std::count(m_callbacks.begin(), m_callbacks.end(), caller));
}

void COPCGroup::WakeRemoval()
{
    if (m_removalsWaiting > 0)
        WakeAllConditionVariable(&m_workChanged);
}

LONG COPCGroup::AddWork()
{
    CSingleLock lock(&m_lock);
    InnerUnknown()->AddRef();
    return ++m_pendingWork;
}

LONG COPCGroup::ReleaseWork()
{
    bool handedOver;
    LONG left;
    {
        CSingleLock lock(&m_lock);
        handedOver = m_removalsWaiting > 0;
        if (handedOver)
            ++m_handedOverReferences;
        left = --m_pendingWork;
        WakeRemoval();
    }
    // Otherwise released after the work unit, as it may be the last.
    if (!handedOver)
        InnerUnknown()->Release();
    return left;
}

void COPCGroup::BeginCallback(const Caller &caller)
{
    CSingleLock lock(&m_lock);
    m_callbacks.push_back(caller);
}

void COPCGroup::EndCallback(const Caller &caller)
{
    CSingleLock lock(&m_lock);
    auto it = std::find(m_callbacks.begin(), m_callbacks.end(), caller);
    if (it != m_callbacks.end())
        m_callbacks.erase(it);
    WakeRemoval();
}

void COPCGroup::BeginRemoval()
{
    LONG handedOver;
    {
        CSingleLock lock(&m_lock);
        m_removing = true;
        m_callback.Close();
        SetActive(FALSE);
        Caller self = Caller::Current();
        ++m_removalsWaiting;
        // The callbacks of this logical thread wait for this removal: every
        // other unit of work is waited for.
        while (m_pendingWork - CallbacksOf(self) > 0)
            if (!SleepConditionVariableCS(&m_workChanged, m_lock.Native(), INFINITE))
                INTERNAL_ASSERT_FAILED("wait for the group's work");
        --m_removalsWaiting;
        handedOver = m_removalsWaiting == 0 ? std::exchange(m_handedOverReferences, 0) : 0;
        // A scan still inside this caller's callback must not reach an owner
        // that may be gone when it returns.
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
    m_removing = true;
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
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (m_removing)
            return E_FAIL;
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
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (m_removing)
            return E_FAIL;
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
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (m_removing || !m_owner)
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
    return ComBoundary([&]() -> HRESULT {
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
            if (m_removing)
                return E_FAIL;
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
