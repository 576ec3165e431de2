#pragma once
// An ordered set of unsigned values kept as a singly linked list of disjoint,
// non-adjacent ranges. Not thread-safe: callers hold the allocator's lock.
//
// The ranges come from slabs that the set owns, not a heap block apiece: the
// released set of a long-running server keeps a range for every group it has
// removed (item handles between them are never given back), and a block of
// the heap would cost twice the range itself.
#include <new>

template <class T> class CRangeSet {
public:
    struct Range {
        Range *next;
        T low;
        T high;
    };

    CRangeSet() = default;
    CRangeSet(T low, T high)
    {
        m_head = NewRange(nullptr, low, high);
        if (!m_head)
            throw std::bad_alloc();
    }
    virtual ~CRangeSet() { Clear(); }
    CRangeSet(const CRangeSet &) = delete;
    CRangeSet &operator=(const CRangeSet &) = delete;

    bool IsEmpty() const { return m_head == nullptr; }
    const Range *Head() const { return m_head; }

    void Insert(T v)
    {
        Range *prev = nullptr;
        Range *cur = Walk(v, prev);
        if (prev && prev->high + 1 == v) {
            prev->high = v;
            if (cur && prev->high + 1 == cur->low) {
                prev->high = cur->high;
                prev->next = cur->next;
                FreeRange(cur);
            }
            return;
        }
        if (!cur || v < cur->low - 1) {
            // Out of memory: the value stays out of the set, which only delays
            // its reuse; the allocator never hands out a number twice.
            Range *fresh = NewRange(cur, v, v);
            if (fresh)
                Link(prev, fresh);
            return;
        }
        if (cur->low - 1 == v)
            cur->low = v;
    }

    void Remove(T v)
    {
        Range *prev = nullptr;
        Range *cur = Walk(v, prev);
        if (!cur || cur->low > v)
            return;
        if (v == cur->low) {
            if (cur->low == cur->high) {
                Link(prev, cur->next);
                FreeRange(cur);
            } else {
                ++cur->low;
            }
        } else if (v == cur->high) {
            --cur->high;
        } else {
            // Out of memory: keep only the lower part; the upper values are
            // lost to the set rather than handed out twice.
            Range *upper = NewRange(cur->next, static_cast<T>(v + 1), cur->high);
            if (upper)
                cur->next = upper;
            cur->high = v - 1;
        }
    }

    T TakeLowest()
    {
        if (!m_head)
            return 0;
        T v = m_head->low;
        Remove(v);
        return v;
    }

private:
    // First range whose high is at least v; prev is the range before it.
    Range *Walk(T v, Range *&prev) const
    {
        prev = nullptr;
        Range *cur = m_head;
        while (cur && cur->high < v) {
            prev = cur;
            cur = cur->next;
        }
        return cur;
    }
    void Link(Range *prev, Range *next)
    {
        if (prev)
            prev->next = next;
        else
            m_head = next;
    }
    // About a page of ranges.
    static constexpr unsigned kSlabRanges = 255;
    struct Slab {
        Slab *next;
        Range ranges[kSlabRanges];
    };

    // Null when memory is short.
    Range *NewRange(Range *next, T low, T high) noexcept
    {
        if (!m_free) {
            Slab *slab = new (std::nothrow) Slab;
            if (!slab)
                return nullptr;
            slab->next = m_slabs;
            m_slabs = slab;
            for (Range &r : slab->ranges) {
                r.next = m_free;
                m_free = &r;
            }
        }
        Range *r = m_free;
        m_free = r->next;
        *r = Range{next, low, high};
        return r;
    }
    void FreeRange(Range *r) noexcept
    {
        r->next = m_free;
        m_free = r;
    }
    // Frees every range, with the slabs they live in.
    void Clear()
    {
        m_head = nullptr;
        m_free = nullptr;
        while (m_slabs) {
            Slab *next = m_slabs->next;
            delete m_slabs;
            m_slabs = next;
        }
    }

    Range *m_head = nullptr;
    Range *m_free = nullptr; // ranges of the slabs not in the list
    Slab *m_slabs = nullptr;
};
