#include "ItemTable.h"

#include <algorithm>

size_t CItemTable::Position(OPCHANDLE handle) const
{
    // Rising handles: a new one is almost always past the last.
    if (m_entries.empty() || m_entries.back().handle < handle)
        return m_entries.size();
    return std::lower_bound(m_entries.begin(), m_entries.end(), handle,
                            [](const Entry &entry, OPCHANDLE h) { return entry.handle < h; }) -
           m_entries.begin();
}

COPCItem *CItemTable::Find(OPCHANDLE handle) const
{
    size_t i = Position(handle);
    return i < m_entries.size() && m_entries[i].handle == handle ? m_entries[i].item : nullptr;
}

bool CItemTable::Insert(std::unique_ptr<COPCItem> item)
{
    OPCHANDLE handle = item->ServerHandle();
    size_t i = Position(handle);
    if (i < m_entries.size() && m_entries[i].handle == handle) {
        if (m_entries[i].item)
            return false;
        m_entries[i].item = item.release(); // fills the hole the same handle left
        --m_holes;
        return true;
    }
    // May throw: the item is still owned here until the entry exists.
    m_entries.insert(m_entries.begin() + i, {handle, nullptr})->item = item.release();
    return true;
}

bool CItemTable::Erase(OPCHANDLE handle)
{
    size_t i = Position(handle);
    if (i == m_entries.size() || m_entries[i].handle != handle || !m_entries[i].item)
        return false;
    // The entry is a hole before the item goes: its destructor may call back
    // into the group, which must not find it any more.
    std::unique_ptr<COPCItem> item(m_entries[i].item);
    m_entries[i].item = nullptr;
    ++m_holes;
    item.reset();
    if (m_holes > 64 && m_holes > m_entries.size() / 2)
        Compact();
    return true;
}

void CItemTable::Clear()
{
    for (Entry &entry : m_entries) {
        std::unique_ptr<COPCItem> item(entry.item);
        entry.item = nullptr;
    }
    m_entries.clear();
    m_entries.shrink_to_fit();
    m_holes = 0;
}

void CItemTable::Compact()
{
    m_entries.erase(
        std::remove_if(m_entries.begin(), m_entries.end(), [](const Entry &entry) { return entry.item == nullptr; }),
        m_entries.end());
    m_holes = 0;
}
