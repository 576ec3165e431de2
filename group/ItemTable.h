#pragma once
// A group's items by server handle. A vector of (handle, item) entries in
// ascending handle order rather than a tree: a plant's group holds tens of
// thousands of items, and a tree node per item would cost more memory than
// the entry itself. Handles come from the process-wide allocator, which hands
// out rising numbers, so an insertion almost always appends; a removal
// leaves a hole that later compaction closes, so that removing many items
// stays linear.
#include "OPCItem.h"

#include <algorithm>
#include <memory>
#include <vector>

class CItemTable {
public:
    CItemTable() = default;
    ~CItemTable() { Clear(); }
    CItemTable(const CItemTable &) = delete;
    CItemTable &operator=(const CItemTable &) = delete;

    COPCItem *Find(OPCHANDLE handle) const;
    // Takes the item; false (and the item deleted) when its handle is taken.
    bool Insert(std::unique_ptr<COPCItem> item);
    // Deletes the item; false when there is none with that handle.
    bool Erase(OPCHANDLE handle);
    // Deletes every item.
    void Clear();
    // Room for more items, so that inserting them cannot fail half-way. The
    // table at least doubles when it grows: a client that adds its items one
    // per call would otherwise have it copied whole at every call.
    void Reserve(size_t more)
    {
        size_t needed = m_entries.size() + more;
        if (needed > m_entries.capacity())
            m_entries.reserve(std::max(needed, m_entries.capacity() * 2));
    }
    size_t size() const { return m_entries.size() - m_holes; }
    bool empty() const { return size() == 0; }

    // f(COPCItem &) for every item in ascending handle order.
    template <class F> void ForEach(F f) const
    {
        for (const Entry &entry : m_entries)
            if (entry.item)
                f(*entry.item);
    }

private:
    // Packed to 12 bytes (a handle and a pointer on 4-byte boundaries,
    // which the processor reads as fast): a plant's group has an entry for
    // each of its tens of thousands of items.
#pragma pack(push, 4)
    struct Entry {
        OPCHANDLE handle;
        COPCItem *item; // null: a hole left by a removal
    };
#pragma pack(pop)
    static_assert(sizeof(void *) != 8 || sizeof(Entry) == 12, "an entry is a handle and a pointer");
    // The index of the entry of handle, or where it would go.
    size_t Position(OPCHANDLE handle) const;
    void Compact();

    std::vector<Entry> m_entries;
    size_t m_holes = 0;
};
