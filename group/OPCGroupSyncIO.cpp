// IOPCSyncIO of the group and the read and write passes that the
// asynchronous transactions reuse.
#include "ComUtil.h"
#include "OPCGroup.h"
#include "OpcErrors.h"
#include "TaskMem.h"

HRESULT COPCGroup::ReadPass(OPCDATASOURCE source, DWORD count, const OPCHANDLE *handles,
                            std::vector<ReadResult> &results)
{
    results.resize(count);
    bool anyFailed = false;
    for (DWORD i = 0; i < count; ++i) {
        ReadResult &r = results[i];
        VariantInit(&r.value);
        COPCItem *item = FindItem(handles[i]);
        if (item)
            r.client = item->ClientHandle();
        if (!item)
            r.error = OPC_E_INVALIDHANDLE;
        else if (!(item->AccessRights() & OPC_READABLE))
            r.error = OPC_E_BADRIGHTS;
        else
            r.error = item->Read(source, &r.client, &r.value, &r.quality, &r.time);
        if (FAILED(r.error)) {
            r.quality = 0;
            VariantClear(&r.value);
            anyFailed = true;
        }
    }
    return anyFailed ? S_FALSE : S_OK;
}

HRESULT COPCGroup::WritePass(DWORD count, const OPCHANDLE *handles, const VARIANT *values, HRESULT *errors,
                             OPCHANDLE *clientHandles)
{
    bool anyFailed = false;
    for (DWORD i = 0; i < count; ++i) {
        COPCItem *item = FindItem(handles[i]);
        if (!item) {
            errors[i] = OPC_E_INVALIDHANDLE;
        } else {
            if (clientHandles)
                clientHandles[i] = item->ClientHandle();
            errors[i] = item->Write(values[i]);
        }
        anyFailed |= errors[i] != S_OK;
    }
    return anyFailed ? S_FALSE : S_OK;
}

void COPCGroup::WritePass(const std::vector<OPCHANDLE> &handles, const std::vector<VARIANT> &values, WriteResults &out)
{
    out.overall = WritePass(out.Count(), handles.data(), values.data(), out.errors.data(), out.clients.data());
}

STDMETHODIMP COPCGroup::Read(OPCDATASOURCE dwSource, DWORD dwCount, OPCHANDLE *phServer, OPCITEMSTATE **ppItemValues,
                             HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(ppItemValues) || !IsWritableOut(ppErrors))
            return E_INVALIDARG;
        *ppItemValues = nullptr;
        *ppErrors = nullptr;
        if ((dwSource != OPC_DS_CACHE && dwSource != OPC_DS_DEVICE) || !IsReadableArray(phServer, dwCount))
            return E_INVALIDARG;
        TaskMem<OPCITEMSTATE> states;
        TaskMem<HRESULT> errors;
        if (!states.Allocate(dwCount) || !errors.Allocate(dwCount))
            return E_OUTOFMEMORY;
        std::vector<ReadResult> results;
        HRESULT overall = ReadPass(dwSource, dwCount, phServer, results);
        for (DWORD i = 0; i < dwCount; ++i) {
            OPCITEMSTATE &s = states[i];
            s.hClient = results[i].client;
            s.ftTimeStamp = results[i].time;
            s.wQuality = results[i].quality;
            s.vDataValue = results[i].value; // moved in
            errors[i] = results[i].error;
        }
        *ppItemValues = states.Detach();
        *ppErrors = errors.Detach();
        return overall;
    });
}

STDMETHODIMP COPCGroup::Write(DWORD dwCount, OPCHANDLE *phServer, VARIANT *pItemValues, HRESULT **ppErrors)
{
    return GroupBoundary([&]() -> HRESULT {
        CSingleLock lock(&m_lock);
        if (!IsWritableOut(ppErrors))
            return E_INVALIDARG;
        *ppErrors = nullptr;
        if (!IsReadableArray(phServer, dwCount) || !IsReadableArray(pItemValues, dwCount))
            return E_INVALIDARG;
        TaskMem<HRESULT> errors;
        if (!errors.Allocate(dwCount))
            return E_OUTOFMEMORY;
        HRESULT overall = WritePass(dwCount, phServer, pItemValues, errors.Get());
        *ppErrors = errors.Detach();
        return overall;
    });
}

HRESULT COPCGroup::ReadForProperties(const wchar_t *itemId, PropertyRead &out)
{
    CSingleLock lock(&m_lock);
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(itemId);
    def.hClient = 100;
    OPCITEMRESULT result = {};
    std::unique_ptr<COPCItem> item = COPCItem::Create(def);
    if (!item || FAILED(item->Init(this, def, result)))
        return E_FAIL;
    COPCItem *raw = item.get();
    if (!m_items.Insert(std::move(item)))
        return E_FAIL;
    OPCHANDLE client;
    HRESULT hr = raw->Read(OPC_DS_DEVICE, &client, out.value.Get(), &out.quality, &out.time);
    out.rights = raw->AccessRights();
    out.canonical = result.vtCanonicalDataType;
    return hr;
}
