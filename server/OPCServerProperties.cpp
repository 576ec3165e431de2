// IOPCItemProperties of the server object.
#include "CallPass.h"
#include "ComPtr.h"
#include "ComUtil.h"
#include "ItemProperties.h"
#include "OPCGroup.h"
#include "OPCServer.h"
#include "OpcErrors.h"
#include "Services.h"
#include "TaskMem.h"

#include <vector>

namespace {
std::vector<DWORD> OfferedFor(ItemKind kind)
{
    switch (kind) {
    case ItemKind::KnownItem:
        return {1, 2, 3, 4, 5, 6, 101};
    case ItemKind::Unlisted:
        return {1, 2, 3, 4, 5, 6};
    case ItemKind::KnownBranch:
        return {101};
    default:
        return {};
    }
}

void SetDate(VARIANT &v, const FILETIME &utc)
{
    SYSTEMTIME st = {};
    DATE date = 0;
    FileTimeToSystemTime(&utc, &st);
    SystemTimeToVariantTime(&st, &date);
    V_VT(&v) = VT_DATE;
    V_DATE(&v) = date;
}

HRESULT SetText(VARIANT &v, const std::wstring &text)
{
    V_VT(&v) = VT_BSTR;
    V_BSTR(&v) = SysAllocString(text.c_str());
    if (V_BSTR(&v))
        return S_OK;
    V_VT(&v) = VT_EMPTY;
    return E_FAIL;
}
} // namespace

HRESULT COPCServer::PropertyDeviceRead(const wchar_t *itemId, COPCGroup::PropertyRead &out)
{
    // One read at a time per server object, in a group outside the registry.
    CSingleLock lock(&m_lock);
    COPCGroup *group = COPCGroup::Create();
    if (!group)
        return E_FAIL;
    ComPtr<IUnknown> keep(group->InnerUnknown()); // its release destroys group and item
    return group->ReadForProperties(itemId, out);
}

STDMETHODIMP COPCServer::QueryAvailableProperties(LPWSTR szItemID, DWORD *pdwCount, DWORD **ppPropertyIDs,
                                                  LPWSTR **ppDescriptions, VARTYPE **ppvtDataTypes)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(pdwCount) || !IsWritableOut(ppPropertyIDs) || !IsWritableOut(ppDescriptions) ||
            !IsWritableOut(ppvtDataTypes) || !szItemID)
            return E_INVALIDARG;
        *pdwCount = 0;
        *ppPropertyIDs = nullptr;
        *ppDescriptions = nullptr;
        *ppvtDataTypes = nullptr;
        AddrNodePtr node;
        ItemKind kind = ClassifyItem(ServerServices::AddressSpace(), szItemID, node);
        if (kind == ItemKind::Invalid)
            return OPC_E_UNKNOWNITEMID;
        std::vector<DWORD> offered = OfferedFor(kind);
        TaskMem<DWORD> ids;
        TaskMem<LPWSTR> descriptions;
        TaskMem<VARTYPE> types;
        if (!ids.Allocate(offered.size()) || !descriptions.Allocate(offered.size()) || !types.Allocate(offered.size()))
            return E_OUTOFMEMORY;
        for (size_t i = 0; i < offered.size(); ++i) {
            const PropertyRecord *p = FindProperty(offered[i]);
            ids[i] = p->id;
            types[i] = p->id != 2                    ? p->type
                       : kind == ItemKind::KnownItem ? node->DataType()
                                                     : static_cast<VARTYPE>(VT_R8);
            descriptions[i] = TaskStrDup(p->description);
            if (!descriptions[i]) {
                for (size_t j = 0; j < i; ++j)
                    CoTaskMemFree(descriptions[j]);
                return E_OUTOFMEMORY;
            }
        }
        *pdwCount = static_cast<DWORD>(offered.size());
        *ppPropertyIDs = ids.Detach();
        *ppDescriptions = descriptions.Detach();
        *ppvtDataTypes = types.Detach();
        return S_OK;
    });
}

STDMETHODIMP COPCServer::GetItemProperties(LPWSTR szItemID, DWORD dwCount, DWORD *pdwPropertyIDs, VARIANT **ppvData,
                                           HRESULT **ppErrors)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        if (!IsWritableOut(ppvData) || !IsWritableOut(ppErrors) || !szItemID ||
            !IsReadableArray(pdwPropertyIDs, dwCount))
            return E_INVALIDARG;
        *ppvData = nullptr;
        *ppErrors = nullptr;
        AddrNodePtr node;
        ItemKind kind = ClassifyItem(ServerServices::AddressSpace(), szItemID, node);
        if (kind == ItemKind::Invalid)
            return OPC_E_UNKNOWNITEMID;
        TaskMem<VARIANT> values;
        TaskMem<HRESULT> errors;
        if (!values.Allocate(dwCount) || !errors.Allocate(dwCount))
            return E_OUTOFMEMORY;
        auto clearValues = [&] {
            for (DWORD i = 0; i < dwCount; ++i)
                VariantClear(&values[i]);
        };
        HRESULT result = S_OK;
        COPCGroup::PropertyRead read;
        bool readDone = false;
        auto ensureRead = [&]() -> HRESULT {
            if (readDone)
                return S_OK;
            VariantClear(read.value.Get());
            HRESULT hr = PropertyDeviceRead(szItemID, read);
            readDone = SUCCEEDED(hr) || hr == OPC_E_BADRIGHTS;
            return readDone ? S_OK : hr;
        };
        for (DWORD i = 0; i < dwCount; ++i) {
            VARIANT &v = values[i];
            VariantInit(&v);
            DWORD id = pdwPropertyIDs[i];
            HRESULT &e = errors[i];
            e = S_OK;
            if (kind == ItemKind::KnownBranch) {
                e = id == 101 ? SetText(v, node->DisplayName()) : OPC_E_INVALID_PID;
                continue;
            }
            if (id == 6) {
                V_VT(&v) = VT_R4;
                V_R4(&v) = 1.0f;
                continue;
            }
            bool needsRead = kind == ItemKind::Unlisted ? (id >= 1 && id <= 5) : (id >= 2 && id <= 4);
            if (kind == ItemKind::KnownItem && !(id >= 1 && id <= 5) && id != 101) {
                e = OPC_E_INVALID_PID;
                continue;
            }
            if (kind == ItemKind::Unlisted && !(id >= 1 && id <= 5)) {
                e = OPC_E_INVALID_PID;
                continue;
            }
            if (needsRead) {
                HRESULT hr = ensureRead();
                if (FAILED(hr)) {
                    if (kind == ItemKind::Unlisted) {
                        clearValues();
                        return hr; // the whole call fails with the read's code
                    }
                    result = hr;
                    e = E_FAIL;
                    continue;
                }
                result = S_OK;
            }
            switch (id) {
            case 1:
                V_VT(&v) = VT_I2;
                V_I2(&v) = static_cast<SHORT>(kind == ItemKind::KnownItem ? node->DataType() : read.canonical);
                break;
            case 2:
                VariantCopy(&v, read.value.Get());
                break;
            case 3:
                V_VT(&v) = VT_I2;
                V_I2(&v) = static_cast<SHORT>(read.quality);
                break;
            case 4:
                SetDate(v, read.time);
                break;
            case 5:
                V_VT(&v) = VT_I4;
                V_I4(&v) = static_cast<LONG>(kind == ItemKind::KnownItem ? node->AccessRights() : read.rights);
                break;
            default: // 101 of a known item
                e = SetText(v, node->DisplayName());
                break;
            }
        }
        *ppvData = values.Detach();
        *ppErrors = errors.Detach();
        // A known item whose value could not be read still gets its other
        // properties: the per-property E_FAIL and S_FALSE tell the client.
        return FAILED(result) ? S_FALSE : result;
    });
}

STDMETHODIMP COPCServer::LookupItemIDs(LPWSTR szItemID, DWORD dwCount, DWORD *pdwPropertyIDs, LPWSTR **ppszNewItemIDs,
                                       HRESULT **ppErrors)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(ppszNewItemIDs) || !IsWritableOut(ppErrors) || !szItemID ||
            !IsReadableArray(pdwPropertyIDs, dwCount))
            return E_INVALIDARG;
        *ppszNewItemIDs = nullptr;
        *ppErrors = nullptr;
        AddrNodePtr node;
        ItemKind kind = ClassifyItem(ServerServices::AddressSpace(), szItemID, node);
        if (kind == ItemKind::Invalid)
            return OPC_E_INVALIDITEMID;
        TaskMem<LPWSTR> ids;
        TaskMem<HRESULT> errors;
        if (!ids.Allocate(dwCount) || !errors.Allocate(dwCount))
            return E_OUTOFMEMORY;
        bool anyFailed = false;
        for (DWORD i = 0; i < dwCount; ++i) {
            DWORD id = pdwPropertyIDs[i];
            if (id == 2 && kind != ItemKind::KnownBranch) {
                ids[i] = TaskStrDup(szItemID);
                if (!ids[i]) {
                    for (DWORD j = 0; j < i; ++j)
                        CoTaskMemFree(ids[j]);
                    return E_OUTOFMEMORY;
                }
                errors[i] = S_OK;
                continue;
            }
            errors[i] = (id >= 1 && id <= 6) || id == 101 ? E_FAIL : OPC_E_INVALID_PID;
            anyFailed = true;
        }
        *ppszNewItemIDs = ids.Detach();
        *ppErrors = errors.Detach();
        return anyFailed ? S_FALSE : S_OK;
    });
}
