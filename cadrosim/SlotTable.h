#pragma once
// Where a library's link keeps its subscriptions and a node's session its
// feeds: in blocks of places, found by the slot of their id. A plant's server
// holds a subscription for every item, a hundred thousand and more. Each in
// a heap block of its own cost the block's header and rounding, and a table
// by id ten bytes more a slot (twenty while its arrays grew). Here a place
// is the object's own size, and its slot's generation and state (two bytes)
// lie in the same block; the free places make a list through themselves.
//
// A place is taken by Take and given back by Give, after its object is
// destroyed; Leave in between only takes the object out of the table (Find
// no longer finds it) while calls already under way may still hold it. When
// the last place is given back, the blocks go with it. The owner's lock
// guards everything.
#include <cstdint>
#include <cstring>
#include <memory>
#include <new>
#include <vector>

namespace cadrosim {

// An id is the slot + 1 in its low kSlotBits, under kGenerationBits of the
// slot's generation.
template <class T, uint32_t kSlotBits, uint32_t kGenerationBits = 32 - kSlotBits> class SlotTable {
public:
    SlotTable() = default;
    SlotTable(const SlotTable &) = delete;
    SlotTable &operator=(const SlotTable &) = delete;

    // Storage for a new object, in the table from now on, and its id: the
    // slot's generation, then the slot + 1 (0 is no id). Null when every
    // slot is taken or memory is short.
    void *Take(uint32_t &id)
    {
        uint32_t slot;
        if (m_free != kNone) {
            slot = m_free;
            memcpy(&m_free, Place(slot), sizeof m_free);
        } else {
            // The last slot is left out: an id of all ones is none.
            if (m_next + 1 >= kSlotMask || !Reach(m_next))
                return nullptr;
            slot = m_next++;
        }
        uint16_t &state = State(slot);
        state |= kIn;
        id = (static_cast<uint32_t>(state & kGenerationMask) << kSlotBits) | (slot + 1);
        ++m_live;
        return Place(slot);
    }

    // The object of id while it is in the table, else null.
    T *Find(uint32_t id) const
    {
        uint32_t slot = (id & kSlotMask) - 1;
        if (slot >= m_next || State(slot) != (kIn | (id >> kSlotBits)))
            return nullptr;
        return static_cast<T *>(Place(slot));
    }

    // Out of the table: a later object of the slot gets the next generation,
    // which tells its id from this one's (whose values may still be on
    // their way).
    void Leave(uint32_t id)
    {
        uint16_t &state = State((id & kSlotMask) - 1);
        state = static_cast<uint16_t>(((state & kGenerationMask) + 1) & kGenerationMask);
    }

    // The storage of id back, its object destroyed and out of the table.
    void Give(uint32_t id)
    {
        uint32_t slot = (id & kSlotMask) - 1;
        memcpy(Place(slot), &m_free, sizeof m_free);
        m_free = slot;
        if (--m_live == 0)
            Release();
    }

    // Where the object of id would be, to fetch ahead; null beyond every
    // slot taken so far.
    const void *Where(uint32_t id) const
    {
        uint32_t slot = (id & kSlotMask) - 1;
        return slot < m_next ? Place(slot) : nullptr;
    }

    // f(object) for every object in the table.
    template <class F> void ForEach(F f) const
    {
        for (uint32_t slot = 0; slot < m_next; ++slot)
            if (State(slot) & kIn)
                f(static_cast<T *>(Place(slot)));
    }

    size_t Live() const { return m_live; }

    // Every place back at once, the objects already destroyed (or trivially
    // destructible): the blocks go.
    void Clear()
    {
        m_live = 0;
        Release();
    }

private:
    static constexpr uint32_t kSlotMask = (1u << kSlotBits) - 1;
    static_assert(kSlotBits + kGenerationBits <= 32, "an id has 32 bits");
    static constexpr uint16_t kGenerationMask = static_cast<uint16_t>((1u << kGenerationBits) - 1);
    static constexpr uint16_t kIn = 0x8000;
    static_assert(kGenerationMask < kIn, "the generation leaves the state's top bit free");
    static constexpr uint32_t kPerBlock = 1024;
    static constexpr uint32_t kNone = UINT32_MAX;
    static_assert(sizeof(T) >= sizeof(uint32_t), "a free place holds the next free slot");

    struct Block {
        uint16_t states[kPerBlock];
        alignas(T) unsigned char places[kPerBlock][sizeof(T)];
    };

    uint16_t &State(uint32_t slot) const { return m_blocks[slot / kPerBlock]->states[slot % kPerBlock]; }
    void *Place(uint32_t slot) const { return m_blocks[slot / kPerBlock]->places[slot % kPerBlock]; }

    // Whether slot has a block, made when it is the first of one.
    bool Reach(uint32_t slot)
    {
        if (slot / kPerBlock < m_blocks.size())
            return true;
        std::unique_ptr<Block> block(new (std::nothrow) Block);
        if (!block)
            return false;
        for (uint16_t &state : block->states)
            state = m_firstGeneration;
        m_blocks.push_back(std::move(block));
        return true;
    }

    // Every place given back: the blocks go. The generations they held are
    // lost, so the next blocks start at a new one.
    void Release()
    {
        std::vector<std::unique_ptr<Block>>().swap(m_blocks);
        m_next = 0;
        m_free = kNone;
        m_firstGeneration = static_cast<uint16_t>((m_firstGeneration + 1) & kGenerationMask);
    }

    std::vector<std::unique_ptr<Block>> m_blocks;
    uint32_t m_next = 0; // slots below it have been taken at least once
    uint32_t m_free = kNone;
    size_t m_live = 0;
    uint16_t m_firstGeneration = 0;
};

} // namespace cadrosim
