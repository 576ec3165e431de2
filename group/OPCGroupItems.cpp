// IOPCItemMgt of the group: adding, validating, removing and changing items,
// and the enumerator of their attributes.
#include "CallPass.h"
#include "ComUtil.h"
#include "EnumItemAttributes.h"
#include "ItemIdChecker.h"
#include "ItemServices.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "TaskMem.h"
#include "Trace.h"
#include "ValueConversion.h"

#include <cstdlib>
#include <cstring>

namespace {

HRESULT Overall(const HRESULT *errors, DWORD count)
{
    for (DWORD i = 0; i < count; ++i)
        if (FAILED(errors[i]))
            return S_FALSE;
    return S_OK;
}
} // namespace

COPCItem *COPCGroup::FindItem(OPCHANDLE handle)
{
    return m_items.Find(handle);
}

template <class PerItem>
HRESULT COPCGroup::ForEachHandle(DWORD count, const OPCHANDLE *handles, HRESULT **ppErrors, PerItem perItem)
{
    if (!IsWritableOut(ppErrors))
        return E_INVALIDARG;
    *ppErrors = nullptr;
    if (!IsReadableArray(handles, count))
        return E_INVALIDARG;
    TaskMem<HRESULT> errors;
    if (!errors.Allocate(count))
        return E_OUTOFMEMORY;
    CSingleLock lock(&m_lock);
    for (DWORD i = 0; i < count; ++i) {
        COPCItem *item = FindItem(handles[i]);
        errors[i] = item ? perItem(i, *item) : OPC_E_INVALIDHANDLE;
    }
    HRESULT overall = Overall(errors.Get(), count);
    *ppErrors = errors.Detach();
    return overall;
}

HRESULT COPCGroup::BeginItemDefinitions(DWORD count, const OPCITEMDEF *items, OPCITEMRESULT **ppResults,
                                        HRESULT **ppErrors, TaskMem<OPCITEMRESULT> &results, TaskMem<HRESULT> &errors)
{
    if (!IsWritableOut(ppResults) || !IsWritableOut(ppErrors))
        return E_INVALIDARG;
    *ppResults = nullptr;
    *ppErrors = nullptr;
    if (!IsReadableArray(items, count))
        return E_INVALIDARG;
    if (!results.Allocate(count) || !errors.Allocate(count))
        return E_OUTOFMEMORY;
    return S_OK;
}

STDMETHODIMP COPCGroup::AddItems(DWORD dwCount, OPCITEMDEF *pItemArray, OPCITEMRESULT **ppAddResults,
                                 HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        CSingleLock lock(&m_lock);
        TaskMem<OPCITEMRESULT> results;
        TaskMem<HRESULT> errors;
        HRESULT hr = BeginItemDefinitions(dwCount, pItemArray, ppAddResults, ppErrors, results, errors);
        if (SUCCEEDED(hr)) {
            ItemServices::ReadAhead(pItemArray, dwCount);
            hr = AddItemsLocked(dwCount, pItemArray, results.Get(), errors.Get());
        }
        if (FAILED(hr))
            return hr;
        *ppAddResults = results.Detach();
        *ppErrors = errors.Detach();
        return hr;
    });
}

HRESULT COPCGroup::AddItemsLocked(DWORD count, const OPCITEMDEF *items, OPCITEMRESULT *results, HRESULT *errors)
{
    // The items this call added go again unless it completes: a failure, or
    // an exception (out of memory) part-way, leaves the group as it was.
    struct Undo {
        COPCGroup &group;
        std::vector<OPCHANDLE> added;
        bool done = false;
        ~Undo()
        {
            if (!done)
                for (auto it = added.rbegin(); it != added.rend(); ++it)
                    group.m_items.Erase(*it);
        }
    } undo{*this, {}};
    undo.added.reserve(count); // no allocation between an insertion and its record
    m_items.Reserve(count);
    for (DWORD i = 0; i < count; ++i) {
        std::unique_ptr<COPCItem> item = COPCItem::Create(items[i]);
        if (!item)
            return E_OUTOFMEMORY;
        errors[i] = item->Init(this, items[i], results[i]);
        if (FAILED(errors[i])) {
            memset(&results[i], 0, sizeof results[i]);
            continue; // the item goes, ending any subscription it made
        }
        OPCHANDLE handle = item->ServerHandle();
        if (!m_items.Insert(std::move(item))) {
            INTERNAL_ASSERT_FAILED("item handle already in the item map");
            return E_FAIL;
        }
        undo.added.push_back(handle);
    }
    undo.done = true;
    return Overall(errors, count);
}

STDMETHODIMP COPCGroup::ValidateItems(DWORD dwCount, OPCITEMDEF *pItemArray, BOOL, OPCITEMRESULT **ppValidationResults,
                                      HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        CSingleLock lock(&m_lock);
        TaskMem<OPCITEMRESULT> results;
        TaskMem<HRESULT> errors;
        HRESULT begun = BeginItemDefinitions(dwCount, pItemArray, ppValidationResults, ppErrors, results, errors);
        if (FAILED(begun))
            return begun;
        ItemServices::ReadAhead(pItemArray, dwCount);
        for (DWORD i = 0; i < dwCount; ++i) {
            const OPCITEMDEF &def = pItemArray[i];
            VARTYPE canonical = VT_R8;
            DWORD rights = OPC_READABLE | OPC_WRITEABLE;
            if (!def.szItemID || !*def.szItemID) {
                errors[i] = OPC_E_INVALIDITEMID;
                continue;
            }
            if (FAILED(CheckItemIdentifier(def.szItemID))) {
                errors[i] = OPC_E_UNKNOWNITEMID;
                continue;
            }
            if (!ItemServices::FindNode(def.szItemID, canonical, rights)) {
                canonical = VT_R8;
                rights = OPC_READABLE | OPC_WRITEABLE;
            }
            if (def.vtRequestedDataType != VT_EMPTY && FAILED(IsConvertible(canonical, def.vtRequestedDataType))) {
                errors[i] = OPC_E_BADTYPE;
                continue;
            }
            results[i].vtCanonicalDataType = canonical;
            results[i].dwAccessRights = rights;
            errors[i] = S_OK;
        }
        HRESULT overall = Overall(errors.Get(), dwCount);
        *ppValidationResults = results.Detach();
        *ppErrors = errors.Detach();
        return overall;
    });
}

STDMETHODIMP COPCGroup::RemoveItems(DWORD dwCount, OPCHANDLE *phServer, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        return ForEachHandle(dwCount, phServer, ppErrors, [this](DWORD, COPCItem &item) -> HRESULT {
            if (!m_items.Erase(item.ServerHandle())) {
                INTERNAL_ASSERT_FAILED("item erase");
                return E_FAIL;
            }
            return S_OK;
        });
    });
}

STDMETHODIMP COPCGroup::SetActiveState(DWORD dwCount, OPCHANDLE *phServer, BOOL bActive, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        return ForEachHandle(dwCount, phServer, ppErrors,
                             [bActive](DWORD, COPCItem &item) { return item.SetActive(bActive ? TRUE : FALSE); });
    });
}

STDMETHODIMP COPCGroup::SetClientHandles(DWORD dwCount, OPCHANDLE *phServer, OPCHANDLE *phClient, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        if (!IsReadableArray(phClient, dwCount) && IsWritableOut(ppErrors)) {
            *ppErrors = nullptr;
            return E_INVALIDARG;
        }
        return ForEachHandle(dwCount, phServer, ppErrors, [phClient](DWORD i, COPCItem &item) {
            item.SetClientHandle(phClient[i]);
            return S_OK;
        });
    });
}

STDMETHODIMP COPCGroup::SetDatatypes(DWORD dwCount, OPCHANDLE *phServer, VARTYPE *pRequestedDatatypes,
                                     HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        if (!IsReadableArray(pRequestedDatatypes, dwCount) && IsWritableOut(ppErrors)) {
            *ppErrors = nullptr;
            return E_INVALIDARG;
        }
        return ForEachHandle(dwCount, phServer, ppErrors, [pRequestedDatatypes](DWORD i, COPCItem &item) {
            item.SetRequestedType(pRequestedDatatypes[i]);
            return S_OK;
        });
    });
}

STDMETHODIMP COPCGroup::CreateEnumerator(REFIID riid, LPUNKNOWN *ppUnk)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(ppUnk))
            return E_INVALIDARG;
        *ppUnk = nullptr;
        if (!IsEqualIID(riid, IID_IEnumOPCItemAttributes))
            return E_INVALIDARG;
        auto snapshot = std::make_shared<ItemAttributesSnapshot>();
        if (!TakeAttributes(*snapshot))
            return E_OUTOFMEMORY;
        HRESULT hr = CEnumOPCItemAttributes::Create(snapshot, 0, riid, reinterpret_cast<void **>(ppUnk));
        if (FAILED(hr))
            return hr == E_OUTOFMEMORY ? hr : E_FAIL;
        return m_items.empty() ? S_FALSE : S_OK;
    });
}

bool COPCGroup::TakeAttributes(ItemAttributesSnapshot &snapshot)
{
    snapshot.records.resize(m_items.size());
    size_t i = 0;
    bool complete = true;
    m_items.ForEach(
        [&](COPCItem &item) { complete = complete && SUCCEEDED(item.GetAttributes(snapshot.records[i++], malloc)); });
    return complete;
}

HRESULT COPCGroup::CopyItems(IOPCItemMgt *target)
{
    ItemAttributesSnapshot attributes;
    {
        CSingleLock lock(&m_lock);
        if (!TakeAttributes(attributes))
            return E_OUTOFMEMORY;
    }
    if (attributes.records.empty())
        return S_OK;
    std::vector<OPCITEMDEF> defs(attributes.records.size());
    for (size_t i = 0; i < defs.size(); ++i) {
        const OPCITEMATTRIBUTES &a = attributes.records[i];
        defs[i] = {a.szAccessPath, a.szItemID, a.bActive, a.hClient, 0, nullptr, a.vtRequestedDataType, 0};
    }
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    HRESULT hr = target->AddItems(static_cast<DWORD>(defs.size()), defs.data(), &results, &errors);
    if (results) {
        for (size_t i = 0; i < defs.size(); ++i)
            CoTaskMemFree(results[i].pBlob);
    }
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    return hr;
}
