#pragma once
// A map of integer keys in one flat table (open addressing, linear probing,
// entries moved back on erase rather than marked): a key and its value take
// one slot of a single block, where a node-based map takes a heap block of
// several times that for each. One key value (kFree) marks free slots and
// cannot be stored.
#include <cstdint>
#include <utility>
#include <vector>

namespace cadrosim {

template <class Key, class Value, Key kFree> class FlatMap {
public:
    Value *Find(Key key)
    {
        if (m_count == 0)
            return nullptr;
        for (size_t i = Home(key);; i = Next(i)) {
            if (m_slots[i].key == key)
                return &m_slots[i].value;
            if (m_slots[i].key == kFree)
                return nullptr;
        }
    }
    // The key's value, inserted (value-initialised) when it is not there.
    // The reference holds until the next insertion.
    Value &operator[](Key key)
    {
        if ((m_count + 1) * 4 > m_slots.size() * 3)
            Grow();
        size_t i = Home(key);
        while (m_slots[i].key != key && m_slots[i].key != kFree)
            i = Next(i);
        if (m_slots[i].key == kFree) {
            m_slots[i].key = key;
            m_slots[i].value = Value();
            ++m_count;
        }
        return m_slots[i].value;
    }
    bool Erase(Key key)
    {
        if (m_count == 0)
            return false;
        size_t hole = Home(key);
        while (m_slots[hole].key != key) {
            if (m_slots[hole].key == kFree)
                return false;
            hole = Next(hole);
        }
        // Each later entry of the run moves into the hole unless its home
        // lies cyclically after the hole, up to where it stands.
        for (size_t i = Next(hole); m_slots[i].key != kFree; i = Next(i)) {
            size_t home = Home(m_slots[i].key);
            bool stays = hole < i ? (home > hole && home <= i) : (home > hole || home <= i);
            if (!stays) {
                m_slots[hole] = std::move(m_slots[i]);
                hole = i;
            }
        }
        m_slots[hole].key = kFree;
        --m_count;
        return true;
    }
    size_t Size() const { return m_count; }
    // Empties the map and gives its memory back.
    void Clear()
    {
        std::vector<Slot>().swap(m_slots);
        m_count = 0;
    }

private:
    struct Slot {
        Key key = kFree;
        Value value{};
    };
    size_t Mask() const { return m_slots.size() - 1; }
    size_t Next(size_t i) const { return (i + 1) & Mask(); }
    size_t Home(Key key) const
    {
        uint64_t h = static_cast<uint64_t>(key) * 0x9e3779b97f4a7c15ull;
        return static_cast<size_t>(h ^ (h >> 32)) & Mask();
    }
    void Grow()
    {
        std::vector<Slot> old(m_slots.empty() ? 16 : m_slots.size() * 2);
        old.swap(m_slots);
        m_count = 0;
        for (Slot &slot : old)
            if (slot.key != kFree)
                (*this)[slot.key] = std::move(slot.value);
    }

    std::vector<Slot> m_slots; // a power of two in size, at most three quarters full
    size_t m_count = 0;
};

} // namespace cadrosim
