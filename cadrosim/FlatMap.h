#pragma once
// Flat tables (open addressing, linear probing, entries moved back on erase
// rather than marked): an entry takes one slot of a single block, where a
// node-based map takes a heap block of several times that for each.
//
// FlatMap maps integer keys to values; one key value (kFree) marks free
// slots and cannot be stored. FlatIndex keeps only 32-bit handles of
// objects that hold their own 64-bit keys (the table asks keyOf for a
// handle's key), so that an index costs four bytes an entry.
#include <cstdint>
#include <utility>
#include <vector>

namespace cadrosim {

// The probing that both share. Traits: Key KeyOf(const Entry &) and
// bool IsFree(const Entry &); a free entry is a value-initialised Entry.
template <class Entry, class Key, class Traits> class FlatTable {
public:
    explicit FlatTable(Traits traits = Traits()) : m_traits(std::move(traits)) {}

    Entry *Find(Key key)
    {
        if (m_count == 0)
            return nullptr;
        for (size_t i = Home(key);; i = Next(i)) {
            if (m_traits.IsFree(m_slots[i]))
                return nullptr;
            if (m_traits.KeyOf(m_slots[i]) == key)
                return &m_slots[i];
        }
    }
    // The entry of key, or a free one where it goes (the caller fills it,
    // and must then call Added). Room for one more first: throws
    // std::bad_alloc, the table unchanged, when it cannot be had.
    Entry &Place(Key key)
    {
        Reserve(1);
        size_t i = Home(key);
        while (!m_traits.IsFree(m_slots[i]) && m_traits.KeyOf(m_slots[i]) != key)
            i = Next(i);
        return m_slots[i];
    }
    void Added() { ++m_count; }
    // Room for more entries: inserting that many then cannot fail.
    void Reserve(size_t more)
    {
        while ((m_count + more) * 4 > m_slots.size() * 3)
            Grow();
    }
    bool Erase(Key key)
    {
        Entry *found = Find(key);
        if (!found)
            return false;
        size_t hole = static_cast<size_t>(found - m_slots.data());
        // Each later entry of the run moves into the hole unless its home
        // lies cyclically after the hole, up to where it stands.
        for (size_t i = Next(hole); !m_traits.IsFree(m_slots[i]); i = Next(i)) {
            size_t home = Home(m_traits.KeyOf(m_slots[i]));
            bool stays = hole < i ? (home > hole && home <= i) : (home > hole || home <= i);
            if (!stays) {
                m_slots[hole] = std::move(m_slots[i]);
                hole = i;
            }
        }
        m_slots[hole] = Entry();
        --m_count;
        return true;
    }
    size_t Size() const { return m_count; }
    // Empties the table and gives its memory back.
    void Clear()
    {
        std::vector<Entry>().swap(m_slots);
        m_count = 0;
    }

private:
    size_t Mask() const { return m_slots.size() - 1; }
    size_t Next(size_t i) const { return (i + 1) & Mask(); }
    size_t Home(Key key) const
    {
        uint64_t h = static_cast<uint64_t>(key) * 0x9e3779b97f4a7c15ull;
        return static_cast<size_t>(h ^ (h >> 32)) & Mask();
    }
    void Grow()
    {
        std::vector<Entry> old(m_slots.empty() ? 16 : m_slots.size() * 2);
        old.swap(m_slots);
        for (Entry &entry : old)
            if (!m_traits.IsFree(entry))
                Place(m_traits.KeyOf(entry)) = std::move(entry);
    }

    Traits m_traits;
    std::vector<Entry> m_slots; // a power of two in size, at most three quarters full
    size_t m_count = 0;
};

template <class Key, class Value, Key kFree> class FlatMap {
public:
    Value *Find(Key key)
    {
        Slot *slot = m_table.Find(key);
        return slot ? &slot->value : nullptr;
    }
    // The key's value, inserted (value-initialised) when it is not there.
    // The reference holds until the next insertion.
    Value &operator[](Key key)
    {
        Slot &slot = m_table.Place(key);
        if (slot.key == kFree) {
            slot.key = key;
            slot.value = Value();
            m_table.Added();
        }
        return slot.value;
    }
    void Reserve(size_t more) { m_table.Reserve(more); }
    bool Erase(Key key) { return m_table.Erase(key); }
    size_t Size() const { return m_table.Size(); }
    void Clear() { m_table.Clear(); }

private:
    struct Slot {
        Key key = kFree;
        Value value{};
    };
    struct Traits {
        static Key KeyOf(const Slot &slot) { return slot.key; }
        static bool IsFree(const Slot &slot) { return slot.key == kFree; }
    };
    FlatTable<Slot, Key, Traits> m_table;
};

// Handles (never 0) by a 64-bit key that keyOf(handle) reads from the
// object; every handle's key must stay as it was while it is indexed.
template <class KeyReader> class FlatIndex {
public:
    explicit FlatIndex(KeyReader keyOf) : m_table(Traits{std::move(keyOf)}) {}
    // The handle indexed under key, or 0.
    uint32_t Find(uint64_t key)
    {
        uint32_t *found = m_table.Find(key);
        return found ? *found : 0;
    }
    // Indexes handle under its key, unless another handle has that key
    // (false). Throws std::bad_alloc, the index unchanged, when memory is
    // short.
    bool Insert(uint32_t handle, uint64_t key)
    {
        uint32_t &slot = m_table.Place(key);
        if (slot != 0)
            return slot == handle;
        slot = handle;
        m_table.Added();
        return true;
    }
    // Takes handle out, when it is the one indexed under key.
    void Erase(uint32_t handle, uint64_t key)
    {
        uint32_t *found = m_table.Find(key);
        if (found && *found == handle)
            m_table.Erase(key);
    }
    void Reserve(size_t more) { m_table.Reserve(more); }
    size_t Size() const { return m_table.Size(); }
    void Clear() { m_table.Clear(); }

private:
    struct Traits {
        KeyReader reader;
        uint64_t KeyOf(uint32_t handle) const { return reader(handle); }
        static bool IsFree(uint32_t handle) { return handle == 0; }
    };
    FlatTable<uint32_t, uint64_t, Traits> m_table;
};

} // namespace cadrosim
