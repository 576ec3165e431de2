#pragma once
// One data value of the Cadro network as a group's client sees it: identity,
// handles, types, rights, the newest network value (device record), the
// value last handed to the client (last reported record) and the item's own
// network subscription. Owned and deleted by its group.
//
// An item is one heap block: its identifier and access path follow the
// object in the same allocation (a byte a character when both are ASCII, as
// a plant's identifiers nearly always are), and it links itself into the
// group's active list. A plant adds tens of thousands of items, each of
// which would otherwise cost three or four more blocks.
#include "CadroNetwork.h"
#include "ItemOwner.h"
#include "ManualResetEvent.h"
#include "NetworkValue.h"
#include "SyncObject.h"
#include "ValueConversion.h"
#include "opcda.h"

#include <cstdint>
#include <memory>
#include <new>
#include <string_view>

class COPCItem {
public:
    // An item with the texts of definition (a null text is empty); null
    // when memory is short.
    static std::unique_ptr<COPCItem> Create(const OPCITEMDEF &definition);
    ~COPCItem();
    COPCItem(const COPCItem &) = delete;
    COPCItem &operator=(const COPCItem &) = delete;
    static void operator delete(void *block) noexcept { ::operator delete(block); }

    // The rest of definition, the one given to Create (its identifier is
    // looked up and subscribed to from there).
    HRESULT Init(CItemOwner *group, const OPCITEMDEF &definition, OPCITEMRESULT &result);
    HRESULT SetActive(BOOL active);
    // Copies of the texts come from allocate (CoTaskMemAlloc or malloc).
    HRESULT GetAttributes(OPCITEMATTRIBUTES &record, void *(*allocate)(size_t));
    HRESULT Read(OPCDATASOURCE source, OPCHANDLE *client, VARIANT *value, WORD *quality, FILETIME *time);
    HRESULT Write(const VARIANT &value);
    HRESULT CheckChanged(double deadbandFraction, OPCHANDLE *client, VARIANT *value, WORD *quality, FILETIME *time,
                         bool *changed);
    HRESULT SetOutOfService();

    // Network updates, from the real-time client.
    void OnDataUpdate(uint32_t flags, const CadroValue &value, int32_t errorFlag, const FILETIME &time);
    void OnAttributesUpdate(const CadroAttributes &attributes);
    void OnStatusUpdate(uint32_t status);

    OPCHANDLE ServerHandle() const { return m_serverHandle; }
    DWORD AccessRights();
    OPCHANDLE ClientHandle();
    void SetClientHandle(OPCHANDLE client);
    void SetRequestedType(VARTYPE type);
    CActiveItemList::Links &ActiveLinks() { return m_activeLinks; }

private:
    COPCItem(const wchar_t *itemId, size_t itemIdLength, const wchar_t *accessPath, size_t accessPathLength,
             bool narrow);
    static void *operator new(size_t size, size_t textBytes, const std::nothrow_t &) noexcept;
    static void operator delete(void *block, size_t, const std::nothrow_t &) noexcept { ::operator delete(block); }
    // The identifier, its NUL, the access path and its NUL, after the object:
    // characters of Char (char when m_narrowTexts, else wchar_t).
    template <class Char> Char *Texts() const { return reinterpret_cast<Char *>(const_cast<COPCItem *>(this) + 1); }
    // The length of the text at offset (in characters): the texts are
    // kept with their terminators rather than their lengths, which only
    // GetAttributes needs.
    size_t StoredLength(size_t offset) const;
    // A copy of the text at offset (in characters), from allocate.
    wchar_t *CopyText(size_t offset, size_t length, void *(*allocate)(size_t)) const;

    // Converts an output value to the requested type when one is set.
    HRESULT ToRequestedType(VARIANT *value);
    void CopyDeviceToLastReported();
    // Under the lock: a value (or quality, or time) from the network.
    void StoreDeviceValue(uint32_t flags, const CadroValue &value, int32_t errorFlag, const FILETIME &time);

    CSlimLock m_lock;
    // What the network writes at every update and the scan reads at every
    // period comes first, next to the lock, so that both touch few cache
    // lines of items that are not in the cache any more (an update touches
    // the first 32 bytes, the event in the lock's padding included).
    // The fields are ordered so that no padding is left between them (the
    // values are 10 bytes on 2-byte boundaries).
    CManualResetEvent m_valueArrived; // created unsignalled; sleeps on m_lock
    bool m_narrowTexts = false;
    CNetworkValue m_deviceValue;
    FILETIME m_deviceTime = {};
    WORD m_deviceQuality = 0xC0;
    WORD m_lastQuality = 0x00;
    HRESULT m_lastReadResult = S_OK;
    CNetworkValue m_lastValue;
    VARTYPE m_requestedType = VT_EMPTY;
    VARTYPE m_canonicalType = VT_EMPTY;
    BYTE m_accessRights = 3; // OPC_READABLE | OPC_WRITEABLE
    bool m_active = false;
    FILETIME m_lastTime = {};
    OPCHANDLE m_clientHandle = 0;
    OPCHANDLE m_serverHandle = 0;
    CItemOwner *m_group = nullptr;
    CActiveItemList::Links m_activeLinks;
    CadroDataItem *m_dataItem = nullptr;
};
