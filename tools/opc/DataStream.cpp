#include "DataStream.h"

#include "Variant.h"

#include <cstring>

namespace {
const size_t kGroupHeader = 20, kValue = 16;

DWORD Dword(const BYTE *p)
{
    DWORD v;
    memcpy(&v, p, 4);
    return v;
}
WORD Word(const BYTE *p)
{
    WORD v;
    memcpy(&v, p, 2);
    return v;
}

// The value at offset, into out; strings follow their VARIANT as a byte
// length, the characters and a terminator.
bool ReadValue(const BYTE *bytes, size_t size, size_t offset, VARIANT &out)
{
    if (offset > size || size - offset < kValue)
        return false;
    VARTYPE type = Word(bytes + offset);
    if (type != VT_BSTR) {
        // Only plain values are copied: pointers (arrays, references,
        // interfaces) mean nothing outside the sender's process.
        if (IsPlainType(type))
            memcpy(&out, bytes + offset, kValue);
        return true;
    }
    size_t at = offset + kValue;
    if (size - at < 4)
        return false;
    DWORD length = Dword(bytes + at);
    at += 4;
    if (length % 2 != 0 || length > size - at || size - at - length < 2)
        return false;
    BSTR text = SysAllocStringLen(nullptr, length / 2);
    if (!text)
        return false;
    memcpy(text, bytes + at, length);
    V_VT(&out) = VT_BSTR;
    V_BSTR(&out) = text;
    return true;
}
} // namespace

StreamItem::StreamItem()
{
    VariantInit(&value);
}

StreamItem::StreamItem(StreamItem &&other) noexcept : client(other.client), quality(other.quality), time(other.time)
{
    value = other.value;
    VariantInit(&other.value);
}

StreamItem::~StreamItem()
{
    VariantClear(&value);
}

bool ReadDataStream(const BYTE *bytes, size_t size, bool withTime, DataStream &out)
{
    if (!bytes || size < kGroupHeader)
        return false;
    DWORD declared = Dword(bytes);
    DWORD count = Dword(bytes + 4);
    out.groupClient = Dword(bytes + 8);
    out.transactionId = Dword(bytes + 12);
    out.status = static_cast<HRESULT>(Dword(bytes + 16));
    size_t header = withTime ? 20 : 12;
    if (declared > size || declared < kGroupHeader || count > (declared - kGroupHeader) / header)
        return false;
    size = declared; // nothing past the stream's own size counts
    out.items.clear();
    out.items.reserve(count);
    for (DWORD i = 0; i < count; ++i) {
        const BYTE *h = bytes + kGroupHeader + i * header;
        StreamItem item;
        item.client = Dword(h);
        item.quality = Word(h + 8);
        if (withTime)
            memcpy(&item.time, h + 12, sizeof(FILETIME));
        if (!ReadValue(bytes, size, Dword(h + 4), item.value))
            return false;
        out.items.push_back(std::move(item));
    }
    return true;
}
