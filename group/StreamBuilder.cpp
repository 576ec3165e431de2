#include "StreamBuilder.h"

#include "ComPtr.h"

#include <cstring>

namespace {
struct Formats {
    CLIPFORMAT data, dataTime, writeComplete;
    Formats()
        : data(static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATA"))),
          dataTime(static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATDATATIME"))),
          writeComplete(static_cast<CLIPFORMAT>(RegisterClipboardFormatA("OPCSTMFORMATWRITECOMPLETE")))
    {
    }
};
const Formats &TheFormats()
{
    static const Formats formats; // registered during static initialisation below
    return formats;
}
const Formats &g_registered = TheFormats();

#pragma pack(push, 1)
struct GroupHeader {
    DWORD dwSize, dwItemCount, hClientGroup, dwTransactionID;
    HRESULT hrStatus;
};
struct ItemHeader1 {
    DWORD hClient, dwValueOffset;
    WORD wQuality, wReserved;
    FILETIME ftTimeStampItem;
};
struct ItemHeader2 {
    DWORD hClient, dwValueOffset;
    WORD wQuality, wReserved;
};
struct GroupHeaderWrite {
    DWORD dwItemCount, hClientGroup, dwTransactionID;
    HRESULT hrStatus;
};
struct ItemHeaderWrite {
    DWORD hClient;
    HRESULT dwError;
};
#pragma pack(pop)
static_assert(sizeof(GroupHeader) == 20 && sizeof(ItemHeader1) == 20 && sizeof(ItemHeader2) == 12 &&
                  sizeof(GroupHeaderWrite) == 16 && sizeof(ItemHeaderWrite) == 8,
              "OPC stream layouts");
static_assert(sizeof(VARIANT) >= 16, "a stream value is 16 bytes");

HRESULT Seek(IStream *s, ULONGLONG position)
{
    LARGE_INTEGER to;
    to.QuadPart = static_cast<LONGLONG>(position);
    return s->Seek(to, STREAM_SEEK_SET, nullptr);
}

template <class T> HRESULT Put(IStream *s, const T &value)
{
    return s->Write(&value, sizeof value, nullptr);
}

// Writes one value; bytes receives its length in the stream.
HRESULT PutValue(IStream *s, const VARIANT &v, DWORD &bytes)
{
    // Always 16 bytes (vt, three reserved words, eight data bytes), also on
    // 64-bit builds.
    BYTE raw[16];
    memcpy(raw, &v, 16);
    HRESULT hr = s->Write(raw, 16, nullptr);
    bytes = 16;
    if (FAILED(hr) || V_VT(&v) != VT_BSTR)
        return hr;
    DWORD length = V_BSTR(&v) ? SysStringByteLen(V_BSTR(&v)) : 0;
    hr = Put(s, length);
    if (SUCCEEDED(hr) && length)
        hr = s->Write(V_BSTR(&v), length, nullptr);
    WORD zero = 0;
    if (SUCCEEDED(hr))
        hr = Put(s, zero);
    bytes += 4 + length + 2;
    return hr;
}

HRESULT Finish(ComPtr<IStream> &stream, HGLOBAL *out)
{
    return GetHGlobalFromStream(stream.Get(), out);
}
} // namespace

CLIPFORMAT OpcStreams::Data()
{
    return TheFormats().data;
}

CLIPFORMAT OpcStreams::DataTime()
{
    return TheFormats().dataTime;
}

CLIPFORMAT OpcStreams::WriteComplete()
{
    return TheFormats().writeComplete;
}

HRESULT OpcStreams::BuildData(bool withTime, OPCHANDLE hGroup, DWORD transactionId, DWORD count,
                              const OPCHANDLE *clients, const VARIANT *values, const WORD *qualities,
                              const FILETIME *times, HGLOBAL *out)
{
    *out = nullptr;
    ComPtr<IStream> stream;
    HRESULT hr = CreateStreamOnHGlobal(nullptr, FALSE, stream.Out());
    if (FAILED(hr))
        return hr;
    GroupHeader header = {0, count, hGroup, transactionId, S_OK};
    hr = Put(stream.Get(), header);
    const ULONGLONG headerSize = withTime ? sizeof(ItemHeader1) : sizeof(ItemHeader2);
    ULONGLONG headerAt = sizeof(GroupHeader);
    ULONGLONG valueAt = sizeof(GroupHeader) + headerSize * count;
    for (DWORD i = 0; i < count && SUCCEEDED(hr); ++i) {
        hr = Seek(stream.Get(), headerAt);
        if (SUCCEEDED(hr)) {
            DWORD offset = static_cast<DWORD>(valueAt);
            hr = withTime ? Put(stream.Get(), ItemHeader1{clients[i], offset, qualities[i], 0, times[i]})
                          : Put(stream.Get(), ItemHeader2{clients[i], offset, qualities[i], 0});
        }
        headerAt += headerSize;
        DWORD bytes = 0;
        if (SUCCEEDED(hr))
            hr = Seek(stream.Get(), valueAt);
        if (SUCCEEDED(hr))
            hr = PutValue(stream.Get(), values[i], bytes);
        valueAt += bytes;
    }
    STATSTG stat = {};
    if (SUCCEEDED(hr))
        hr = stream->Stat(&stat, STATFLAG_NONAME);
    if (SUCCEEDED(hr)) {
        header.dwSize = static_cast<DWORD>(stat.cbSize.QuadPart);
        hr = Seek(stream.Get(), 0);
    }
    if (SUCCEEDED(hr))
        hr = Put(stream.Get(), header);
    HGLOBAL memory = nullptr;
    HRESULT taken = Finish(stream, &memory);
    if (FAILED(hr) || FAILED(taken)) {
        GlobalFree(memory);
        return FAILED(hr) ? hr : taken;
    }
    *out = memory;
    return S_OK;
}

HRESULT OpcStreams::BuildWriteComplete(OPCHANDLE hGroup, DWORD transactionId, DWORD count, const OPCHANDLE *clients,
                                       const HRESULT *errors, HGLOBAL *out)
{
    *out = nullptr;
    ComPtr<IStream> stream;
    HRESULT hr = CreateStreamOnHGlobal(nullptr, FALSE, stream.Out());
    if (FAILED(hr))
        return hr;
    hr = Put(stream.Get(), GroupHeaderWrite{count, hGroup, transactionId, S_OK});
    for (DWORD i = 0; i < count && SUCCEEDED(hr); ++i)
        hr = Put(stream.Get(), ItemHeaderWrite{clients[i], errors[i]});
    HGLOBAL memory = nullptr;
    HRESULT taken = Finish(stream, &memory);
    if (FAILED(hr) || FAILED(taken)) {
        GlobalFree(memory);
        return FAILED(hr) ? hr : taken;
    }
    *out = memory;
    return S_OK;
}
