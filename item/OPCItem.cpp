#include "OPCItem.h"

#include "IdMgr.h"
#include "ItemServices.h"
#include "OPCCadroClient.h"
#include "OpcErrors.h"
#include "Trace.h"

#include <cstring>

namespace {
constexpr DWORD kFirstValueWaitMs = 3000;

bool IsZero(const FILETIME &t)
{
    return t.dwLowDateTime == 0 && t.dwHighDateTime == 0;
}

size_t TextLength(const wchar_t *text)
{
    return text ? wcslen(text) : 0;
}

bool IsAscii(const wchar_t *text, size_t length)
{
    for (size_t i = 0; i < length; ++i)
        if (text[i] >= 0x80)
            return false;
    return true;
}

template <class Char> void Store(Char *to, const wchar_t *from, size_t length)
{
    for (size_t i = 0; i < length; ++i)
        to[i] = static_cast<Char>(from[i]);
    to[length] = 0;
}
} // namespace

std::unique_ptr<COPCItem> COPCItem::Create(const OPCITEMDEF &definition)
{
    size_t idLength = TextLength(definition.szItemID);
    size_t pathLength = TextLength(definition.szAccessPath);
    if (idLength > UINT32_MAX / 4 || pathLength > UINT32_MAX / 4)
        return nullptr;
    bool narrow = IsAscii(definition.szItemID, idLength) && IsAscii(definition.szAccessPath, pathLength);
    size_t bytes = (idLength + pathLength + 2) * (narrow ? sizeof(char) : sizeof(wchar_t));
    return std::unique_ptr<COPCItem>(
        new (bytes, std::nothrow) COPCItem(definition.szItemID, idLength, definition.szAccessPath, pathLength, narrow));
}

void *COPCItem::operator new(size_t size, size_t textBytes, const std::nothrow_t &) noexcept
{
    return ::operator new(size + textBytes, std::nothrow);
}

COPCItem::COPCItem(const wchar_t *itemId, size_t itemIdLength, const wchar_t *accessPath, size_t accessPathLength,
                   bool narrow)
    : m_narrowTexts(narrow)
{
    if (narrow) {
        Store(Texts<char>(), itemId, itemIdLength);
        Store(Texts<char>() + itemIdLength + 1, accessPath, accessPathLength);
    } else {
        Store(Texts<wchar_t>(), itemId, itemIdLength);
        Store(Texts<wchar_t>() + itemIdLength + 1, accessPath, accessPathLength);
    }
}

size_t COPCItem::StoredLength(size_t offset) const
{
    return m_narrowTexts ? strlen(Texts<char>() + offset) : wcslen(Texts<wchar_t>() + offset);
}

wchar_t *COPCItem::CopyText(size_t offset, size_t length, void *(*allocate)(size_t)) const
{
    auto *copy = static_cast<wchar_t *>(allocate((length + 1) * sizeof(wchar_t)));
    if (!copy)
        return nullptr;
    for (size_t i = 0; i < length; ++i)
        copy[i] = m_narrowTexts ? static_cast<unsigned char>(Texts<char>()[offset + i]) : Texts<wchar_t>()[offset + i];
    copy[length] = L'\0';
    return copy;
}

COPCItem::~COPCItem()
{
    SetActive(FALSE);
    // Released without the item lock: the release waits for callbacks in
    // flight, which take that lock.
    if (m_dataItem)
        m_dataItem->Release();
}

HRESULT COPCItem::Init(CItemOwner *group, const OPCITEMDEF &definition, OPCITEMRESULT &result)
{
    {
        CSlimLockHolder lock(&m_lock);
        memset(&result, 0, sizeof result);
        m_group = group;
        m_clientHandle = definition.hClient;
        m_requestedType = definition.vtRequestedDataType;
        m_serverHandle = CIdMgr::Instance().GetId();
        m_accessRights = OPC_READABLE | OPC_WRITEABLE;
        m_canonicalType = VT_EMPTY;
        if (StoredLength(0) == 0 || !definition.szItemID)
            return OPC_E_INVALIDITEMID;
        if (m_serverHandle == 0)
            return E_OUTOFMEMORY; // no identifier left for a handle
        DWORD rights;
        VARTYPE type;
        if (ItemServices::FindNode(definition.szItemID, type, rights)) {
            m_canonicalType = type;
            m_accessRights = static_cast<BYTE>(rights);
        } else {
            // Unknown to the address space: the requested type, normalized.
            m_canonicalType = NormalizedType(m_requestedType);
            if (m_canonicalType == VT_EMPTY)
                m_canonicalType = VT_R8;
        }
    }
    // Subscribed without the item lock: the library may call back at once.
    if (ComPtr<OPCCadroClient> client = ItemServices::RealTimeClient()) {
        CadroDataItem *dataItem = nullptr;
        HRESULT hr = client->Subscribe(definition.szItemID, this, &dataItem);
        if (FAILED(hr))
            return OPC_E_UNKNOWNITEMID;
        m_dataItem = dataItem;
    }
    CSlimLockHolder lock(&m_lock);
    if (m_requestedType != VT_EMPTY && FAILED(IsConvertible(m_canonicalType, m_requestedType)))
        return OPC_E_BADTYPE;
    result.hServer = m_serverHandle;
    result.vtCanonicalDataType = m_canonicalType;
    result.dwAccessRights = m_accessRights;
    lock.Unlock();
    return SetActive(definition.bActive);
}

HRESULT COPCItem::SetActive(BOOL active)
{
    CSlimLockHolder lock(&m_lock);
    bool activate = active != FALSE;
    if (m_active == activate || !m_group)
        return S_OK;
    CSingleLock groupLock(&m_group->GroupLock());
    m_active = activate;
    if (!activate) {
        m_group->ActiveItems().Erase(this);
        if (m_group->GroupActive())
            m_lastQuality = OPC_QUALITY_OUT_OF_SERVICE;
    } else {
        m_group->ActiveItems().PushFront(this);
    }
    return S_OK;
}

HRESULT COPCItem::SetOutOfService()
{
    CSlimLockHolder lock(&m_lock);
    m_lastQuality = OPC_QUALITY_OUT_OF_SERVICE;
    return S_OK;
}

DWORD COPCItem::AccessRights()
{
    CSlimLockHolder lock(&m_lock);
    return m_accessRights;
}

OPCHANDLE COPCItem::ClientHandle()
{
    CSlimLockHolder lock(&m_lock);
    return m_clientHandle;
}

void COPCItem::SetClientHandle(OPCHANDLE client)
{
    CSlimLockHolder lock(&m_lock);
    m_clientHandle = client;
}

void COPCItem::SetRequestedType(VARTYPE type)
{
    CSlimLockHolder lock(&m_lock);
    m_requestedType = type;
}

HRESULT COPCItem::GetAttributes(OPCITEMATTRIBUTES &record, void *(*allocate)(size_t))
{
    CSlimLockHolder lock(&m_lock);
    memset(&record, 0, sizeof record);
    size_t idLength = StoredLength(0);
    record.szAccessPath = CopyText(idLength + 1, StoredLength(idLength + 1), allocate);
    record.szItemID = CopyText(0, idLength, allocate);
    record.bActive = m_active ? TRUE : FALSE;
    record.hClient = m_clientHandle;
    record.hServer = m_serverHandle;
    record.dwAccessRights = m_accessRights;
    record.vtRequestedDataType = m_requestedType;
    record.vtCanonicalDataType = m_canonicalType;
    record.dwEUType = OPC_NOENUM;
    VariantInit(&record.vEUInfo);
    return record.szAccessPath && record.szItemID ? S_OK : E_OUTOFMEMORY;
}

HRESULT COPCItem::ToRequestedType(VARIANT *value)
{
    if (m_requestedType == VT_EMPTY || m_requestedType == m_canonicalType)
        return S_OK;
    HRESULT hr = VariantChangeType(value, value, 0, m_requestedType);
    if (FAILED(hr))
        VariantClear(value);
    return hr;
}

void COPCItem::CopyDeviceToLastReported()
{
    m_lastValue.CopyFrom(m_deviceValue);
    m_lastQuality = m_deviceQuality;
    m_lastTime = m_deviceTime;
}

HRESULT COPCItem::Read(OPCDATASOURCE source, OPCHANDLE *client, VARIANT *value, WORD *quality, FILETIME *time)
{
    VariantInit(value);
    // Ask the network first, and wait for a first value, without the item
    // lock: updates must be able to arrive meanwhile.
    uint32_t flags = 0;
    CCadroValue record;
    int32_t error = 0;
    FILETIME stamp = {};
    HRESULT asked = S_OK;
    bool arrived = false;
    if (m_dataItem) {
        asked = m_dataItem->Read(&flags, record.Get(), &error, &stamp);
        arrived = SUCCEEDED(asked) && (flags & kCadroHasValue);
        if (arrived)
            asked = S_OK;
        else
            asked = m_valueArrived.Wait(m_lock, kFirstValueWaitMs) ? S_OK : OPC_E_UNKNOWNITEMID;
    }

    // The rest under one hold of the lock (a read of thousands of items).
    CSlimLockHolder lock(&m_lock);
    if (m_dataItem) {
        if (arrived)
            StoreDeviceValue(flags, record.Value(), error, stamp);
        if (SUCCEEDED(asked)) {
            if (m_accessRights == 0 || IsZero(stamp))
                asked = OPC_E_UNKNOWNITEMID;
            else if (!(m_accessRights & OPC_READABLE))
                asked = OPC_E_BADRIGHTS;
        }
        m_lastReadResult = asked;
    }
    *client = m_clientHandle;
    HRESULT result = m_lastReadResult;
    bool inactive = !m_active || (m_group && !m_group->GroupActive());
    if (source != OPC_DS_DEVICE && inactive) {
        m_lastValue.CopyFrom(m_deviceValue);
        m_lastQuality = OPC_QUALITY_OUT_OF_SERVICE;
    } else {
        CopyDeviceToLastReported();
    }
    *quality = m_lastQuality;
    *time = m_lastTime;
    if (FAILED(result))
        return result;
    VARIANT last = m_lastValue.View();
    result = VariantCopy(value, &last);
    if (SUCCEEDED(result))
        result = ToRequestedType(value);
    if (FAILED(result))
        VariantClear(value);
    return result;
}

HRESULT COPCItem::Write(const VARIANT &value)
{
    CSlimLockHolder lock(&m_lock);
    HRESULT hr = S_OK;
    CCadroValue record;
    if (!(m_accessRights & OPC_WRITEABLE)) {
        hr = OPC_E_BADRIGHTS;
    } else {
        // The written value is needed only on its way to the network: an
        // item does not keep it (a write changes nothing a client reads).
        CVariant written;
        CopyVariant(written.Get(), value);
        if (V_VT(written.Get()) != m_canonicalType)
            hr = VariantChangeType(written.Get(), written.Get(), 0, m_canonicalType);
        if (SUCCEEDED(hr))
            hr = VariantToCadroValue(written.Value(), record);
        if (SUCCEEDED(hr)) {
            if (m_dataItem)
                m_dataItem->Write(record.Get()); // the network answers with an update
            else
                hr = E_FAIL;
        }
    }
    return hr;
}

HRESULT COPCItem::CheckChanged(double, OPCHANDLE *client, VARIANT *value, WORD *quality, FILETIME *time, bool *changed)
{
    CSlimLockHolder lock(&m_lock);
    *client = m_clientHandle;
    *changed = false;
    *quality = m_deviceQuality;
    *time = m_deviceTime;
    if (!(m_accessRights & OPC_READABLE))
        return OPC_E_BADRIGHTS;
    // Time stamps are not compared; the deadband has no effect without
    // engineering units. The value is copied only when it is reported: the
    // scan asks every active item at every period.
    if (m_deviceQuality == m_lastQuality && VariantEquals(m_deviceValue.View(), m_lastValue.View()))
        return S_OK;
    *changed = true;
    CopyDeviceToLastReported();
    CopyVariant(value, m_deviceValue.View());
    return ToRequestedType(value);
}

void COPCItem::OnDataUpdate(uint32_t flags, const CadroValue &value, int32_t errorFlag, const FILETIME &time)
{
    CSlimLockHolder lock(&m_lock);
    StoreDeviceValue(flags, value, errorFlag, time);
}

void COPCItem::StoreDeviceValue(uint32_t flags, const CadroValue &value, int32_t errorFlag, const FILETIME &time)
{
    if (flags & kCadroHasQuality)
        m_deviceQuality = errorFlag == 0 ? OPC_QUALITY_GOOD : OPC_QUALITY_BAD;
    if (flags & kCadroHasValue) {
        VARIANT arrived = {};
        m_lastReadResult = CadroValueToVariant(value, &arrived);
        m_deviceValue.Take(arrived);
        m_valueArrived.Set();
    }
    if (flags & kCadroHasTime)
        m_deviceTime = time;
    else
        GetSystemTimeAsFileTime(&m_deviceTime);
}

void COPCItem::OnAttributesUpdate(const CadroAttributes &attributes)
{
    CSlimLockHolder lock(&m_lock);
    if (attributes.mask & 0x02)
        m_canonicalType = NetworkTypeToVarType(attributes.dataType);
    if (attributes.mask & 0x04) {
        m_accessRights = static_cast<BYTE>(((attributes.access & 1) ? OPC_READABLE : 0) |
                                           ((attributes.access & 2) ? OPC_WRITEABLE : 0));
        if (!(m_accessRights & OPC_READABLE))
            m_valueArrived.Set(); // a read waiting for a value stops waiting
    }
}

void COPCItem::OnStatusUpdate(uint32_t status)
{
    if (status == 5 || status == 15) {
        CSlimLockHolder lock(&m_lock);
        m_valueArrived.Reset();
    }
}

// Tens of thousands of items: keep an eye on what each one costs.
static_assert(sizeof(void *) != 8 || sizeof(COPCItem) <= 120, "an item grew");
