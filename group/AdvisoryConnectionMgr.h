#pragma once
// The IDataObject advise connections of one stream format: newest first,
// each with its FORMATETC, advise flags, connection id and sink.
#include "SyncObject.h"

#include <objidl.h>

#include <list>
#include <memory>

class CConnectionData {
public:
    // format.ptd is copied: the caller's target device is the caller's
    // (across the process boundary it is freed when DAdvise returns), and
    // every notification sends the format back.
    CConnectionData(const FORMATETC &format, DWORD advf, IAdviseSink *sink);
    virtual ~CConnectionData();
    CConnectionData(const CConnectionData &) = delete;
    CConnectionData &operator=(const CConnectionData &) = delete;

    FORMATETC format;
    DWORD advf;
    DWORD id;
    IAdviseSink *sink;
};

class CAdvisoryConnectionMgr {
public:
    virtual ~CAdvisoryConnectionMgr() = default;
    // E_OUTOFMEMORY when the target device cannot be copied.
    HRESULT Add(const FORMATETC &format, DWORD advf, IAdviseSink *sink, DWORD *id);
    HRESULT Remove(DWORD id);
    void RemoveAll();
    bool Contains(DWORD id);
    size_t Count();
    // The medium goes to one connection's sink (S_FALSE: no such
    // connection), or to every sink (E_FAIL: none).
    HRESULT SendTo(DWORD id, STGMEDIUM &medium);
    HRESULT SendToAll(STGMEDIUM &medium);

private:
    CCriticalSection m_lock;
    std::list<std::unique_ptr<CConnectionData>> m_connections;
};
