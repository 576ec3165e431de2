#pragma once
// The IDataObject advise connections of one stream format: newest first,
// each with its FORMATETC, advise flags, connection id and sink.
#include "SyncObject.h"

#include <objidl.h>

#include <list>
#include <memory>
#include <vector>

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
    bool remoteSink; // released as a client's sink (SinkRelease)
};

// Connections taken out of a manager for one send: the sinks are called
// with no lock held (a sink may call the group back from another thread),
// and a connection removed meanwhile lives until the send is done.
using ConnectionList = std::vector<std::shared_ptr<CConnectionData>>;

// Calls OnDataChange of every connection, in order, with its own format.
void SendToConnections(const ConnectionList &connections, STGMEDIUM &medium);

class CAdvisoryConnectionMgr {
public:
    virtual ~CAdvisoryConnectionMgr() = default;
    // E_OUTOFMEMORY when the target device cannot be copied.
    HRESULT Add(const FORMATETC &format, DWORD advf, IAdviseSink *sink, DWORD *id);
    HRESULT Remove(DWORD id);
    void RemoveAll();
    bool Contains(DWORD id);
    size_t Count();
    // The connection with that id (empty when none), or every connection,
    // newest first.
    ConnectionList Find(DWORD id);
    ConnectionList All();

private:
    CCriticalSection m_lock{LockOrder::Inner};
    std::list<std::shared_ptr<CConnectionData>> m_connections;
};
