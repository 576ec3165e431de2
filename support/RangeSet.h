#pragma once
// An ordered set of unsigned values kept as a singly linked list of disjoint,
// non-adjacent ranges. Not thread-safe: callers hold the allocator's lock.
#include <new>

template <class T> class CRangeSet {
public:
    struct Range {
        Range *next;
        T low;
        T high;
    };

    CRangeSet() = default;
    CRangeSet(T low, T high) { m_head = new Range{nullptr, low, high}; }
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
                delete cur;
            }
            return;
        }
        if (!cur || v < cur->low - 1) {
            // Out of memory: the value stays out of the set, which only delays
            // its reuse; the allocator never hands out a number twice.
            Range *fresh = new (std::nothrow) Range{cur, v, v};
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
                delete cur;
            } else {
                ++cur->low;
            }
        } else if (v == cur->high) {
            --cur->high;
        } else {
            // Out of memory: keep only the lower part; the upper values are
            // lost to the set rather than handed out twice.
            Range *upper = new (std::nothrow) Range{cur->next, static_cast<T>(v + 1), cur->high};
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
    void Clear()
    {
        while (m_head) {
            Range *next = m_head->next;
            delete m_head;
            m_head = next;
        }
    }

    Range *m_head = nullptr;
};
