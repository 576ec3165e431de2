#pragma once
// A group's active items, linked through the items themselves: an item joins
// and leaves the list without an allocation of its own, and the scan walks it
// in order (the most recently activated item first).
#include <cstddef>

class COPCItem;

class CActiveItemList {
public:
    // The place of an item in the list; part of the item.
    struct Links {
        COPCItem *prev = nullptr;
        COPCItem *next = nullptr;
    };

    class Iterator {
    public:
        explicit Iterator(COPCItem *item) : m_item(item) {}
        COPCItem *operator*() const { return m_item; }
        Iterator &operator++();
        bool operator!=(const Iterator &other) const { return m_item != other.m_item; }

    private:
        COPCItem *m_item;
    };

    CActiveItemList() = default;
    CActiveItemList(const CActiveItemList &) = delete;
    CActiveItemList &operator=(const CActiveItemList &) = delete;

    void PushFront(COPCItem *item);
    // item must be in this list.
    void Erase(COPCItem *item);
    size_t size() const { return m_size; }
    bool empty() const { return m_size == 0; }
    Iterator begin() const { return Iterator(m_first); }
    Iterator end() const { return Iterator(nullptr); }

private:
    COPCItem *m_first = nullptr;
    size_t m_size = 0;
};
