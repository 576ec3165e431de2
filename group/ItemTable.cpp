#include "ItemTable.h"

#include <algorithm>

std::vector<CItemTable::Entry>::const_iterator CItemTable::Position(OPCHANDLE handle) const
{
    return std::lower_bound(m_entries.begin(), m_entries.end(), handle,
                            [](const Entry &entry, OPCHANDLE h) { return entry.handle < h; });
}

COPCItem *CItemTable::Find(OPCHANDLE handle) const
{
    auto it = Position(handle);
    return it != m_entries.end() && it->handle == handle ? it->item : nullptr;
}

bool CItemTable::Insert(std::unique_ptr<COPCItem> item)
{
    OPCHANDLE handle = item->ServerHandle();
    if (m_entries.empty() || m_entries.back().handle < handle) {
        m_entries.push_back({handle, nullptr}); // may throw: the item is still owned here
        m_entries.back().item = item.release();
        return true;
    }
    auto it = m_entries.begin() + (Position(handle) - m_entries.cbegin());
    if (it != m_entries.end() && it->handle == handle) {
        if (it->item)
            return false;
        it->item = item.release(); // fills the hole the same handle left
        --m_holes;
        return true;
    }
    m_entries.insert(it, {handle, nullptr})->item = item.release();
    return true;
}

bool CItemTable::Erase(OPCHANDLE handle)
{
    auto it = m_entries.begin() + (Position(handle) - m_entries.cbegin());
    if (it == m_entries.end() || it->handle != handle || !it->item)
        return false;
    // The entry is a hole before the item goes: its destructor may call back
    // into the group, which must not find it any more.
    std::unique_ptr<COPCItem> item(it->item);
    it->item = nullptr;
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
