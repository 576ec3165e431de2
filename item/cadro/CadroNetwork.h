#pragma once
// The operations and records of the Cadro network client libraries (CDREALT,
// CDBROW, CDSOCK, CDDYNAM, twhmxmem) as the server uses them. The server
// imports these libraries and never contains them.
#include <oaidl.h>
#include <windows.h>

#include <cstddef>
#include <cstdint>

#ifdef CADRO_BUILDING_LIBRARY
#define CADRO_API extern "C" __declspec(dllexport)
#else
#define CADRO_API extern "C" __declspec(dllimport)
#endif

// ---- Values (CDREALT, CDDYNAM) -------------------------------------------

// Type codes of a CadroValue and network data types.
enum : uint32_t {
    kCadroNoValue = 0,
    kCadroCleared = 1,
    kCadroBoolean = 2,
    kCadroNumber = 3,
    kCadroNarrowText = 0x1005,
    kCadroWideText = 0x1006,
    kCadroTextBit = 0x1000,
};

#pragma pack(push, 4)
// 12 bytes: a type word and an 8-byte payload.
struct CadroValue {
    uint32_t type;
    union {
        uint8_t boolean;
        double number;
        IUnknown *text; // reference-counted text object; null for an empty text
    };
};
#pragma pack(pop)
static_assert(sizeof(CadroValue) == 12, "CadroValue is 12 bytes");

// Text objects carried by text values, reached through QueryInterface.
struct ICadroWideText : IUnknown {
    virtual const wchar_t *STDMETHODCALLTYPE Chars() = 0;
};
struct ICadroNarrowText : IUnknown {
    virtual const char *STDMETHODCALLTYPE Chars() = 0;
};

// ---- Real-time subscriptions (CDREALT) -----------------------------------

#pragma pack(push, 2)
struct SubscribeOptions {
    uint32_t a; // always 13
    uint16_t b; // always 7
    uint16_t padding;
    uint32_t c; // always 0
    uint32_t d; // always 0
};
#pragma pack(pop)
static_assert(sizeof(SubscribeOptions) == 16, "SubscribeOptions is 16 bytes");

#pragma pack(push, 1)
// Attributes handed to OnAttributes.
struct CadroAttributes {
    uint32_t mask; // 0x02: dataType valid; 0x04: access valid
    uint8_t reserved1[4];
    uint16_t dataType;
    uint8_t reserved2[4];
    uint32_t access; // bit 0 readable, bit 1 writable
};
#pragma pack(pop)
static_assert(offsetof(CadroAttributes, dataType) == 8 && offsetof(CadroAttributes, access) == 14,
              "attribute record layout");

// Flags of OnData and CadroDataItem::Read.
enum : uint32_t { kCadroHasValue = 0x01, kCadroHasQuality = 0x02, kCadroHasTime = 0x04 };

// Status codes of StatusChange.
enum : uint32_t {
    kCadroStatusConnecting = 13,
    kCadroStatusContacted = 14,
    kCadroStatusDisconnected = 15,
    kCadroStatusSubscribing = 16,
    kCadroStatusSubscribed = 17,
    kCadroStatusSubscribeFailed = 18,
};

struct ICadroRealTimeReceiver : IUnknown {
    virtual HRESULT STDMETHODCALLTYPE OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                             uint32_t timeLow, uint32_t timeHigh) = 0;
    virtual HRESULT STDMETHODCALLTYPE OnAttributes(void *cookie, const CadroAttributes *attributes) = 0;
    virtual HRESULT STDMETHODCALLTYPE StatusChange(void *cookie, uint32_t status, uint32_t reserved1,
                                                   uint32_t reserved2) = 0;
};

struct CadroDataItem : IUnknown {
    virtual HRESULT STDMETHODCALLTYPE Write(const CadroValue *value) = 0;
    virtual HRESULT STDMETHODCALLTYPE Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) = 0;
};

struct CadroRealTime : IUnknown {
    virtual HRESULT STDMETHODCALLTYPE Subscribe(const wchar_t *url, void *cookie, const SubscribeOptions *options,
                                                CadroDataItem **out) = 0;
};

// Never obtained by the server; declared for the release at teardown.
struct CadroSession : IUnknown {};

// ---- Browsing (CDBROW) ---------------------------------------------------

#pragma pack(push, 2)
struct BrowseRecord {
    uint32_t mask;        // valid fields
    BSTR name;            // 0x01
    uint16_t kind;        // 0x02: a character
    uint8_t reserved1[8]; // not read
    uint16_t flags;       // 0x08: bit 0 set for an entry without children
    BSTR description;     // not read
    uint16_t dataType;    // 0x20: network data type
    uint16_t access;      // 0x40: bit 0 readable, bit 1 writable
};
#pragma pack(pop)

enum : uint32_t {
    kBrowseName = 0x01,
    kBrowseKind = 0x02,
    kBrowseFlags = 0x08,
    kBrowseDataType = 0x20,
    kBrowseAccess = 0x40,
    kBrowseFieldMask = 107, // what the server always asks for
};

struct ICadroBrowserReceiver : IUnknown {
    virtual HRESULT STDMETHODCALLTYPE BrowseItemChanged() = 0;
};

struct CadroBrowser : IUnknown {
    virtual HRESULT STDMETHODCALLTYPE Open(const wchar_t *url) = 0;
    virtual HRESULT STDMETHODCALLTYPE Next(uint32_t fieldMask, BrowseRecord *record) = 0;
};

// Interface identifiers, for __uuidof.
__CRT_UUID_DECL(ICadroWideText, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x01)
__CRT_UUID_DECL(ICadroNarrowText, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x02)
__CRT_UUID_DECL(ICadroRealTimeReceiver, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x10)
__CRT_UUID_DECL(CadroDataItem, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x11)
__CRT_UUID_DECL(CadroRealTime, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x12)
__CRT_UUID_DECL(ICadroBrowserReceiver, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x20)
__CRT_UUID_DECL(CadroBrowser, 0x7c3b51a0, 0x6e1d, 0x4f0b, 0x9b, 0x5e, 0x2a, 0x6c, 0x0d, 0x1e, 0x4f, 0x21)

// ---- Library entry points ------------------------------------------------

// CDREALT
CADRO_API bool NewCadroRealTime(int reserved, ICadroRealTimeReceiver *receiver, CadroRealTime **out);
// CDBROW
CADRO_API bool NewCadroBrowser(int reserved, ICadroBrowserReceiver *receiver, CadroBrowser **out);
// CDSOCK: the caller frees the name with SysFreeString.
CADRO_API HRESULT GetHostMachineName(BSTR *out);
// CDDYNAM
CADRO_API void *cdd_malloc(size_t size);
CADRO_API void cdd_free(void *block);
CADRO_API IUnknown *NewUnicodeGuts(const wchar_t *text);
// twhmxmem
CADRO_API void *tw_hmx_mem_malloc(size_t size);
CADRO_API void *tw_hmx_mem_realloc(void *block, size_t size);
CADRO_API void tw_hmx_mem_free(void *block);
