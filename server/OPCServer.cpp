#include "OPCServer.h"

#include "AsyncIOMgr.h"
#include "CodePage.h"
#include "ComEnum2.h"
#include "ComPtr.h"
#include "ComUtil.h"
#include "IdMgr.h"
#include "OPCBrowseServerAddressSpace.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "Services.h"
#include "TaskMem.h"
#include "UpdateScanMgr.h"

#include <algorithm>
#include <iterator>

namespace {
constexpr DWORD kMinUpdateRate = 10;
constexpr WORD kMajorVersion = 1;
constexpr WORD kMinorVersion = 1;
constexpr WORD kBuildNumber = 21;
constexpr wchar_t kVendor[] = L"Tarnwell";

LONG CurrentTimeBias()
{
    TIME_ZONE_INFORMATION tzi = {};
    GetTimeZoneInformation(&tzi);
    return tzi.Bias;
}
} // namespace

COPCServer *COPCServer::Create(IUnknown *outer)
{
    return NewComObject<COPCServer>(outer);
}

void *COPCServer::FindInterface(REFIID riid)
{
    if (IsEqualIID(riid, IID_IOPCServer))
        return static_cast<IOPCServer *>(this);
    if (IsEqualIID(riid, IID_IOPCCommon))
        return static_cast<IOPCCommon *>(this);
    if (IsEqualIID(riid, IID_IOPCItemProperties))
        return static_cast<IOPCItemProperties *>(this);
    if (IsEqualIID(riid, IID_IConnectionPointContainer))
        return static_cast<IConnectionPointContainer *>(this);
    return nullptr;
}

HRESULT COPCServer::CreateOnQuery(REFIID riid, void **ppv)
{
    if (!IsEqualIID(riid, IID_IOPCBrowseServerAddressSpace))
        return E_NOINTERFACE;
    // A new browse object, with its own position, for every query.
    CAddrSpace *space = ServerServices::AddressSpace();
    if (!space)
        return E_FAIL;
    return COPCBrowseServerAddressSpace::Create(space, riid, ppv);
}

HRESULT COPCServer::FinalConstruct()
{
    ServerServices::ServerConstructed();
    m_counted = true;
    // A scanner that cannot start fails the construction as the I/O manager
    // does; the release that follows gives back only the references taken.
    HRESULT hr = CUpdateScanMgr::Acquire(&m_scanMgr);
    if (FAILED(hr))
        return hr;
    hr = CAsyncIOMgr::Acquire(&m_asyncMgr);
    GetSystemTimeAsFileTime(&m_startTime);
    return hr;
}

bool COPCServer::EnterGroupCall()
{
    CSingleLock lock(&m_groupCallLock);
    if (m_closing)
        return false;
    ++m_groupCalls;
    return true;
}

void COPCServer::LeaveGroupCall()
{
    CSingleLock lock(&m_groupCallLock);
    --m_groupCalls;
}

void COPCServer::FinalRelease()
{
    // A group still calling in (a client cloning a group while releasing the
    // server) finishes first; whatever it adds now is refused.
    for (;;) {
        {
            CSingleLock lock(&m_groupCallLock);
            m_closing = true;
            if (m_groupCalls == 0)
                break;
        }
        Sleep(1);
    }
    if (m_counted)
        ServerServices::ServerReleased();
    m_shutdownSink.Close();
    m_shutdownSink.Clear(); // a sink still advised goes with the server (no lock held)
    // No client can reach the object any more: every group goes, by force.
    // The registry lock is not held while a removal waits: a callback in
    // flight may look a group up.
    for (OPCHANDLE handle : m_registry.Handles())
        RemoveGroup(handle, TRUE);
    if (m_scanMgr) {
        CUpdateScanMgr::ReleaseInstance();
        m_scanMgr = nullptr;
    }
    if (m_asyncMgr) {
        CAsyncIOMgr::ReleaseInstance();
        m_asyncMgr = nullptr;
    }
}

STDMETHODIMP COPCServer::AddGroup(LPCWSTR szName, BOOL bActive, DWORD dwRequestedUpdateRate, OPCHANDLE hClientGroup,
                                  LONG *pTimeBias, FLOAT *pPercentDeadband, DWORD dwLCID, OPCHANDLE *phServerGroup,
                                  DWORD *pRevisedUpdateRate, REFIID riid, LPUNKNOWN *ppUnk)
{
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        return AddGroupLocked(szName, bActive, dwRequestedUpdateRate, hClientGroup, pTimeBias, pPercentDeadband, dwLCID,
                              phServerGroup, pRevisedUpdateRate, riid, ppUnk);
    });
}

HRESULT COPCServer::AddGroupLocked(LPCWSTR szName, BOOL bActive, DWORD dwRequestedUpdateRate, OPCHANDLE hClientGroup,
                                   LONG *pTimeBias, FLOAT *pPercentDeadband, DWORD dwLCID, OPCHANDLE *phServerGroup,
                                   DWORD *pRevisedUpdateRate, REFIID riid, LPUNKNOWN *ppUnk)
{
    if (!IsWritableOut(phServerGroup) || !IsWritableOut(pRevisedUpdateRate) || !IsWritableOut(ppUnk))
        return E_INVALIDARG;
    *ppUnk = nullptr;
    *phServerGroup = 0;
    {
        CSingleLock lock(&m_groupCallLock);
        if (m_closing)
            return E_FAIL;
    }

    wchar_t generated[kDefaultGroupNameChars];
    const wchar_t *name = szName;
    if (!szName || !*szName)
        name = MakeDefaultGroupName(generated);
    else if (m_registry.FindName(szName))
        return OPC_E_DUPLICATENAME;

    DWORD rate = dwRequestedUpdateRate;
    HRESULT success = S_OK;
    if (rate < kMinUpdateRate) {
        rate = kMinUpdateRate;
        success = OPC_S_UNSUPPORTEDRATE;
    }
    *pRevisedUpdateRate = rate;
    LONG timeBias = pTimeBias ? *pTimeBias : CurrentTimeBias();
    if (pPercentDeadband && !(*pPercentDeadband >= 0.0f && *pPercentDeadband <= 100.0f))
        return E_INVALIDARG;

    COPCGroup *group = COPCGroup::Create();
    if (!group)
        return E_OUTOFMEMORY;
    ComPtr<IUnknown> keep(group->InnerUnknown()); // until the server's own reference
    group->SetOwner(this);
    HRESULT hr = group->SetName(name);
    if (SUCCEEDED(hr))
        hr = group->QueryInterface(riid, reinterpret_cast<void **>(ppUnk));
    if (SUCCEEDED(hr) && !m_registry.InsertHandle(group->ServerHandle(), group)) {
        INTERNAL_ASSERT_FAILED("group handle already in the handle index");
        hr = E_FAIL;
    }
    if (SUCCEEDED(hr)) {
        *phServerGroup = group->ServerHandle();
        hr = group->SetState(&rate, pRevisedUpdateRate, &bActive, &timeBias, pPercentDeadband, &dwLCID, &hClientGroup);
    }
    if (FAILED(hr)) {
        UndoAddGroup(group, ppUnk);
        *phServerGroup = 0;
        return hr;
    }
    group->InnerUnknown()->AddRef(); // the server's reference, released by RemoveGroup
    ++m_groupCount;
    return success;
}

void COPCServer::UndoAddGroup(COPCGroup *group, LPUNKNOWN *ppUnk)
{
    m_registry.EraseName(group->Name(), group);
    m_registry.EraseHandle(group->ServerHandle(), group);
    if (*ppUnk) {
        (*ppUnk)->Release();
        *ppUnk = nullptr;
    }
    CoDisconnectObject(group->InnerUnknown(), 0);
    group->Destroy();
}

STDMETHODIMP COPCServer::GetErrorString(HRESULT dwError, LCID dwLocale, LPWSTR *ppString)
{
    return ComBoundary([&]() -> HRESULT {
        if (!IsWritableOut(ppString))
            return E_INVALIDARG; // nowhere to write the text
        *ppString = nullptr;
        // The executable's message table first, then the system's messages;
        // the locale goes unchecked as the language.
        char *text = nullptr;
        DWORD n =
            FormatMessageA(FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_HMODULE | FORMAT_MESSAGE_FROM_SYSTEM,
                           GetModuleHandleW(nullptr), static_cast<DWORD>(dwError), dwLocale,
                           reinterpret_cast<char *>(&text), 256, nullptr);
        if (n == 0 || !text)
            return E_FAIL;
        std::wstring wide = FromCodePage(text);
        LocalFree(text);
        *ppString = TaskStrDup(wide.c_str());
        return *ppString ? S_OK : E_OUTOFMEMORY;
    });
}

namespace {
const LCID kLocales[] = {0x409, LOCALE_SYSTEM_DEFAULT, LOCALE_NEUTRAL};
} // namespace

STDMETHODIMP COPCServer::SetLocaleID(LCID dwLcid)
{
    if (std::find(std::begin(kLocales), std::end(kLocales), dwLcid) == std::end(kLocales))
        return E_INVALIDARG;
    CSingleLock lock(&m_lock);
    m_locale = dwLcid;
    return S_OK;
}

STDMETHODIMP COPCServer::GetLocaleID(LCID *pdwLcid)
{
    if (!IsWritableOut(pdwLcid))
        return E_INVALIDARG;
    *pdwLcid = m_locale;
    return S_OK;
}

STDMETHODIMP COPCServer::QueryAvailableLocaleIDs(DWORD *pdwCount, LCID **pdwLcid)
{
    if (!IsWritableOut(pdwCount) || !IsWritableOut(pdwLcid))
        return E_INVALIDARG;
    TaskMem<LCID> locales;
    if (!locales.Allocate(std::size(kLocales)))
        return E_FAIL;
    std::copy(std::begin(kLocales), std::end(kLocales), locales.Get());
    *pdwLcid = locales.Detach();
    *pdwCount = static_cast<DWORD>(std::size(kLocales));
    return S_OK;
}

STDMETHODIMP COPCServer::GetErrorString(HRESULT dwError, LPWSTR *ppString)
{
    return GetErrorString(dwError, m_locale, ppString);
}

STDMETHODIMP COPCServer::SetClientName(LPCWSTR szName)
{
    return ComBoundary([&]() -> HRESULT {
        if (!szName)
            return E_INVALIDARG;
        CSingleLock lock(&m_lock);
        try {
            m_clientName = szName;
        } catch (const std::bad_alloc &) {
            return E_FAIL;
        }
        return S_OK;
    });
}

STDMETHODIMP COPCServer::FindConnectionPoint(REFIID riid, IConnectionPoint **ppCP)
{
    return m_shutdownSink.Find(riid, ppCP);
}

STDMETHODIMP COPCServer::EnumConnectionPoints(IEnumConnectionPoints **ppEnum)
{
    return m_shutdownSink.Enumerate(ppEnum);
}

STDMETHODIMP COPCServer::GetGroupByName(LPCWSTR szName, REFIID riid, LPUNKNOWN *ppUnk)
{
    return ComBoundary([&]() -> HRESULT {
        if (!IsWritableOut(ppUnk) || !szName || !*szName)
            return E_INVALIDARG;
        *ppUnk = nullptr;
        // A reference taken under the registry lock keeps the group alive
        // against a concurrent RemoveGroup until the query is done.
        ComPtr<IUnknown> group;
        {
            CSingleLock lock(&m_registry.Lock());
            COPCGroup *found = m_registry.FindName(szName);
            if (!found)
                return E_INVALIDARG;
            group = ComPtr<IUnknown>(found->InnerUnknown());
        }
        return group->QueryInterface(riid, reinterpret_cast<void **>(ppUnk));
    });
}

STDMETHODIMP COPCServer::GetStatus(OPCSERVERSTATUS **ppServerStatus)
{
    return ComBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(ppServerStatus))
            return E_INVALIDARG;
        *ppServerStatus = nullptr;
        TaskMem<OPCSERVERSTATUS> status;
        if (!status.Allocate(1))
            return E_OUTOFMEMORY;
        status->ftStartTime = m_startTime;
        GetSystemTimeAsFileTime(&status->ftCurrentTime);
        {
            CSingleLock timeLock(&m_updateTimeLock);
            status->ftLastUpdateTime = m_lastUpdateTime;
        }
        status->dwServerState = OPC_STATUS_RUNNING;
        status->dwGroupCount = m_groupCount;
        status->dwBandWidth = 0xFFFFFFFF;
        status->wMajorVersion = kMajorVersion;
        status->wMinorVersion = kMinorVersion;
        status->wBuildNumber = kBuildNumber;
        status->szVendorInfo = TaskStrDup(kVendor);
        if (!status->szVendorInfo)
            return E_OUTOFMEMORY;
        *ppServerStatus = status.Detach();
        return S_OK;
    });
}

STDMETHODIMP COPCServer::RemoveGroup(OPCHANDLE hServerGroup, BOOL bForce)
{
    return ComBoundary([&]() -> HRESULT {
        COPCGroup *group;
        {
            // The server lock covers the registry and the count only. The
            // wait for the group's work below runs without it, on purpose:
            // a client callback in flight may call this server (GetStatus,
            // AddGroup) while its group is being removed, and would wait for
            // the lock for ever. A second removal of the same handle finds
            // it gone and gets E_INVALIDARG.
            CSingleLock lock(&m_lock);
            group = m_registry.FindHandle(hServerGroup);
            if (!group)
                return E_INVALIDARG;
            if (m_registry.EraseName(group->Name(), group) != 1)
                INTERNAL_ASSERT_FAILED("group name missing from the name index");
            if (m_registry.EraseHandle(hServerGroup, group) != 1)
                INTERNAL_ASSERT_FAILED("group handle missing from the handle index");
            --m_groupCount;
        }
        // This call now owns the server's reference, which the registry held.
        return RemoveUnregisteredGroup(group, bForce);
    });
}

HRESULT COPCServer::RemoveUnregisteredGroup(COPCGroup *group, BOOL force)
{
    group->BeginRemoval();
    HRESULT hr;
    if (!force) {
        hr = group->InnerUnknown()->Release() != 0 ? OPC_S_INUSE : S_OK;
    } else {
        hr = CoDisconnectObject(group->InnerUnknown(), 0);
        // Destroyed now whatever the clients hold; a reference that an
        // enumerator still keeps reaches only an empty shell that fails
        // every call, and frees it when released.
        group->Destroy();
        group->InnerUnknown()->Release();
    }
    if (FAILED(hr))
        INTERNAL_ASSERT_FAILED("forced group removal");
    return hr;
}

STDMETHODIMP COPCServer::CreateGroupEnumerator(OPCENUMSCOPE dwScope, REFIID riid, LPUNKNOWN *ppUnk)
{
    return ComBoundary([&]() -> HRESULT {
        if (!IsWritableOut(ppUnk))
            return E_INVALIDARG;
        *ppUnk = nullptr;
        bool wantsUnknown = IsEqualIID(riid, IID_IEnumUnknown);
        if (!wantsUnknown && !IsEqualIID(riid, IID_IEnumString))
            return E_NOINTERFACE;
        if (dwScope == OPC_ENUM_PUBLIC || dwScope == OPC_ENUM_PUBLIC_CONNECTIONS) {
            // There are no public groups; the empty enumerator serves only
            // IEnumUnknown.
            if (!wantsUnknown)
                return E_FAIL;
            HRESULT hr = CEnumUnknown::Create({}, true, riid, reinterpret_cast<void **>(ppUnk));
            return FAILED(hr) ? hr : S_FALSE;
        }
        return EnumerateGroups(riid, ppUnk);
    });
}

HRESULT COPCServer::EnumerateGroups(REFIID riid, LPUNKNOWN *ppUnk)
{
    HRESULT hr;
    size_t count;
    if (IsEqualIID(riid, IID_IEnumUnknown)) {
        std::vector<IUnknown *> groups;
        {
            CSingleLock lock(&m_registry.Lock());
            auto entries = m_registry.ByName();
            groups.reserve(entries.size());
            for (const auto &entry : entries) {
                groups.push_back(entry.second->InnerUnknown());
                groups.back()->AddRef();
            }
        }
        count = groups.size();
        hr = CEnumUnknown::Create(std::move(groups), true, riid, reinterpret_cast<void **>(ppUnk));
    } else {
        auto entries = m_registry.ByName();
        std::vector<LPOLESTR> names;
        names.reserve(entries.size());
        for (const auto &entry : entries)
            names.push_back(TaskStrDup(entry.first.c_str())); // null when out of memory
        count = names.size();
        hr = CEnumString::Create(std::move(names), true, riid, reinterpret_cast<void **>(ppUnk));
    }
    if (hr == E_OUTOFMEMORY)
        return hr;
    if (FAILED(hr))
        return E_FAIL;
    return count == 0 ? S_FALSE : S_OK;
}

void COPCServer::SetLastUpdateTime(const FILETIME &time)
{
    CSingleLock lock(&m_updateTimeLock);
    m_lastUpdateTime = time;
}
