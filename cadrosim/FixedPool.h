#pragma once
// Storage for many objects of one size without a heap block for each: a
// node holds an engine subscription for every member that a library
// subscribed to, a hundred thousand and more, and a block's header and
// rounding would add a sixth to each. Places come from blocks of
// kPerBlock of T; a freed place goes on a list through the free places
// themselves, and when the last place is freed the blocks go with it (a
// pool that held many objects once does not keep their memory while few
// live). Safe from any thread.
#include "SlimSync.h"

#include <cstddef>
#include <memory>
#include <mutex>
#include <new>
#include <vector>

namespace cadrosim {

template <class T, size_t kPerBlock> class FixedPool {
public:
    static constexpr size_t kSize = sizeof(T);
    // Places follow each other at sizeof(T), a multiple of T's alignment,
    // in blocks aligned for any type.
    static_assert(kSize >= sizeof(void *) && alignof(T) >= alignof(void *) && alignof(T) <= alignof(std::max_align_t),
                  "a place holds a free list's link and keeps its object aligned");
    FixedPool() = default;
    FixedPool(const FixedPool &) = delete;
    FixedPool &operator=(const FixedPool &) = delete;
    ~FixedPool()
    {
        // Objects still alive at the process's end (their threads not
        // joined) keep their storage: it goes with the process.
        if (m_live != 0)
            for (auto &block : m_blocks)
                block.release();
    }

    // A place for a T; null when memory is short.
    void *Allocate() noexcept
    {
        std::lock_guard<SlimMutex> l(m_lock);
        void *place;
        if (m_free) {
            place = m_free;
            m_free = *static_cast<void **>(place);
        } else {
            if (m_blocks.empty() || m_used == kPerBlock) {
                if (!AddBlock())
                    return nullptr;
            }
            place = m_blocks.back().get() + m_used++ * kSize;
        }
        ++m_live;
        return place;
    }

    // A place from Allocate back, its object destroyed.
    void Free(void *place) noexcept
    {
        if (!place)
            return;
        std::vector<std::unique_ptr<unsigned char[]>> gone;
        {
            std::lock_guard<SlimMutex> l(m_lock);
            *static_cast<void **>(place) = m_free;
            m_free = place;
            if (--m_live != 0)
                return;
            m_free = nullptr;
            m_used = 0;
            gone.swap(m_blocks);
        }
        // The blocks are given back outside the lock.
    }

    // Places in use, and blocks held: for tests.
    size_t Live()
    {
        std::lock_guard<SlimMutex> l(m_lock);
        return m_live;
    }
    size_t Blocks()
    {
        std::lock_guard<SlimMutex> l(m_lock);
        return m_blocks.size();
    }

private:
    bool AddBlock() noexcept
    {
        try {
            m_blocks.reserve(m_blocks.size() + 1);
        } catch (const std::bad_alloc &) {
            return false;
        }
        // operator new[] aligns for any fundamental type.
        std::unique_ptr<unsigned char[]> block(new (std::nothrow) unsigned char[kSize * kPerBlock]);
        if (!block)
            return false;
        m_blocks.push_back(std::move(block));
        m_used = 0;
        return true;
    }

    SlimMutex m_lock;
    std::vector<std::unique_ptr<unsigned char[]>> m_blocks;
    void *m_free = nullptr; // the freed places, each holding the next's address
    size_t m_used = 0;      // places taken from the newest block
    size_t m_live = 0;
};

} // namespace cadrosim
