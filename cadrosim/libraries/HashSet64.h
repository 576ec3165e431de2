#pragma once
// A set of 64-bit hashes in one flat table (open addressing): a hundred
// thousand of them take 1.6 MB in a single block, where a node-based set
// takes a heap block for each.
#include <cstdint>
#include <vector>

namespace cadrosim {

class HashSet64 {
public:
    bool Contains(uint64_t key) const
    {
        if (m_slots.empty())
            return false;
        key = Stored(key);
        for (size_t i = Start(key);; i = (i + 1) & Mask()) {
            if (m_slots[i] == key)
                return true;
            if (m_slots[i] == 0)
                return false;
        }
    }
    void Insert(uint64_t key)
    {
        if ((m_count + 1) * 2 > m_slots.size())
            Grow();
        key = Stored(key);
        size_t i = Start(key);
        while (m_slots[i] != 0 && m_slots[i] != key)
            i = (i + 1) & Mask();
        if (m_slots[i] == 0) {
            m_slots[i] = key;
            ++m_count;
        }
    }
    size_t Size() const { return m_count; }
    // Empties the set and gives its memory back.
    void Clear()
    {
        std::vector<uint64_t>().swap(m_slots);
        m_count = 0;
    }

private:
    // 0 marks a free slot: a key of 0 is kept as 1 (for hashes, one more
    // collision among 2^64).
    static uint64_t Stored(uint64_t key) { return key ? key : 1; }
    size_t Mask() const { return m_slots.size() - 1; }
    size_t Start(uint64_t key) const { return static_cast<size_t>(key ^ (key >> 29)) & Mask(); }
    void Grow()
    {
        std::vector<uint64_t> old;
        old.swap(m_slots);
        m_slots.assign(old.empty() ? 64 : old.size() * 2, 0);
        m_count = 0;
        for (uint64_t key : old)
            if (key)
                Insert(key);
    }

    std::vector<uint64_t> m_slots; // a power of two in size, at most half full
    size_t m_count = 0;
};

} // namespace cadrosim
