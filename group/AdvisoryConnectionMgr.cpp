#include "AdvisoryConnectionMgr.h"

#include "IdMgr.h"
#include "SinkRelease.h"

#include <cstring>

namespace {
DVTARGETDEVICE *CopyTargetDevice(const DVTARGETDEVICE *device)
{
    if (!device)
        return nullptr;
    auto *copy = static_cast<DVTARGETDEVICE *>(CoTaskMemAlloc(device->tdSize));
    if (copy)
        memcpy(copy, device, device->tdSize);
    return copy;
}
} // namespace

CConnectionData::CConnectionData(const FORMATETC &f, DWORD a, IAdviseSink *s)
    : format(f), advf(a), id(CIdMgr::Instance().GetId()), sink(s), remoteSink(SinkRelease::IsRemote(s))
{
    format.ptd = CopyTargetDevice(f.ptd);
    sink->AddRef();
}

CConnectionData::~CConnectionData()
{
    CoTaskMemFree(format.ptd);
    CIdMgr::Instance().ReleaseId(id);
    SinkRelease::Release(sink, remoteSink);
}

HRESULT CAdvisoryConnectionMgr::Add(const FORMATETC &format, DWORD advf, IAdviseSink *sink, DWORD *id)
{
    auto record = std::make_shared<CConnectionData>(format, advf, sink);
    if (format.ptd && !record->format.ptd)
        return E_OUTOFMEMORY;
    CSingleLock lock(&m_lock);
    *id = record->id;
    m_connections.push_front(std::move(record));
    return S_OK;
}

HRESULT CAdvisoryConnectionMgr::Remove(DWORD id)
{
    std::shared_ptr<CConnectionData> removed; // destroyed after the lock
    CSingleLock lock(&m_lock);
    for (auto it = m_connections.begin(); it != m_connections.end(); ++it) {
        if ((*it)->id == id) {
            removed = std::move(*it);
            m_connections.erase(it);
            return S_OK;
        }
    }
    return S_FALSE;
}

void CAdvisoryConnectionMgr::RemoveAll()
{
    std::list<std::shared_ptr<CConnectionData>> removed;
    CSingleLock lock(&m_lock);
    removed.swap(m_connections);
}

bool CAdvisoryConnectionMgr::Contains(DWORD id)
{
    CSingleLock lock(&m_lock);
    for (auto &c : m_connections)
        if (c->id == id)
            return true;
    return false;
}

size_t CAdvisoryConnectionMgr::Count()
{
    CSingleLock lock(&m_lock);
    return m_connections.size();
}

ConnectionList CAdvisoryConnectionMgr::Find(DWORD id)
{
    CSingleLock lock(&m_lock);
    for (auto &c : m_connections)
        if (c->id == id)
            return {c};
    return {};
}

ConnectionList CAdvisoryConnectionMgr::All()
{
    CSingleLock lock(&m_lock);
    return ConnectionList(m_connections.begin(), m_connections.end());
}

void SendToConnections(const ConnectionList &connections, STGMEDIUM &medium)
{
    for (const auto &c : connections)
        c->sink->OnDataChange(&c->format, &medium);
}
