#pragma once
// Reads the OPC DA 1.0 data streams ("OPCSTMFORMATDATATIME" and
// "OPCSTMFORMATDATA") a group sends to an IAdviseSink. Every offset and
// length is checked against the stream's size: a stream that does not hold
// together yields false.
#include <windows.h>

#include <oleauto.h>

#include <vector>

struct StreamItem {
    DWORD client = 0;
    WORD quality = 0;
    FILETIME time = {};
    VARIANT value; // owned: strings are copied out of the stream
    StreamItem();
    StreamItem(const StreamItem &) = delete;
    StreamItem &operator=(const StreamItem &) = delete;
    StreamItem(StreamItem &&other) noexcept;
    ~StreamItem();
};

struct DataStream {
    DWORD groupClient = 0;
    DWORD transactionId = 0;
    HRESULT status = S_OK;
    std::vector<StreamItem> items;
};

bool ReadDataStream(const BYTE *bytes, size_t size, bool withTime, DataStream &out);
