#include "ActiveItemList.h"

#include "OPCItem.h"

CActiveItemList::Iterator &CActiveItemList::Iterator::operator++()
{
    m_item = m_item->ActiveLinks().next;
    return *this;
}

void CActiveItemList::PushFront(COPCItem *item)
{
    Links &links = item->ActiveLinks();
    links.prev = nullptr;
    links.next = m_first;
    if (m_first)
        m_first->ActiveLinks().prev = item;
    m_first = item;
    ++m_size;
}

void CActiveItemList::Erase(COPCItem *item)
{
    Links &links = item->ActiveLinks();
    if (links.prev)
        links.prev->ActiveLinks().next = links.next;
    else
        m_first = links.next;
    if (links.next)
        links.next->ActiveLinks().prev = links.prev;
    links = Links();
    --m_size;
}
