#include "GroupRegistry.h"

namespace {
template <class Map, class Key> typename Map::mapped_type Find(Map &map, const Key &key)
{
    auto it = map.find(key);
    return it == map.end() ? nullptr : it->second;
}

template <class Map, class Key> size_t Erase(Map &map, const Key &key, COPCGroup *group)
{
    auto it = map.find(key);
    if (it == map.end() || (group && it->second != group))
        return 0;
    map.erase(it);
    return 1;
}
} // namespace

COPCGroup *CGroupRegistry::FindName(const std::wstring &name)
{
    CSingleLock lock(&m_lock);
    return Find(m_byName, name);
}

bool CGroupRegistry::InsertName(const std::wstring &name, COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    return m_byName.emplace(name, group).second;
}

size_t CGroupRegistry::EraseName(const std::wstring &name, COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    return Erase(m_byName, name, group);
}

COPCGroup *CGroupRegistry::FindHandle(OPCHANDLE handle)
{
    CSingleLock lock(&m_lock);
    return Find(m_byHandle, handle);
}

bool CGroupRegistry::InsertHandle(OPCHANDLE handle, COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    return m_byHandle.emplace(handle, group).second;
}

size_t CGroupRegistry::EraseHandle(OPCHANDLE handle, COPCGroup *group)
{
    CSingleLock lock(&m_lock);
    return Erase(m_byHandle, handle, group);
}

std::vector<std::pair<std::wstring, COPCGroup *>> CGroupRegistry::ByName()
{
    CSingleLock lock(&m_lock);
    return {m_byName.begin(), m_byName.end()};
}

std::vector<OPCHANDLE> CGroupRegistry::Handles()
{
    CSingleLock lock(&m_lock);
    std::vector<OPCHANDLE> handles;
    handles.reserve(m_byHandle.size());
    for (const auto &entry : m_byHandle)
        handles.push_back(entry.first);
    return handles;
}
