#include "Memberships.h"

#include "Wire.h"

namespace cadrosim {

Membership *Memberships::AtSlotOf(uint32_t id)
{
    uint32_t slot = wire::SubscriptionSlot(id);
    uint32_t page = slot >> kPageBits;
    if (page >= m_pages.size() || !m_pages[page])
        return nullptr;
    return &m_pages[page][slot & (kPageSize - 1)];
}

Membership *Memberships::PlaceSlotOf(uint32_t id)
{
    uint32_t slot = wire::SubscriptionSlot(id);
    if (slot == UINT32_MAX)
        return nullptr;
    uint32_t page = slot >> kPageBits;
    if (page >= m_pages.size())
        m_pages.resize(page + 1);
    if (!m_pages[page])
        m_pages[page] = std::make_unique<Membership[]>(kPageSize);
    return &m_pages[page][slot & (kPageSize - 1)];
}

void Memberships::Clear()
{
    std::vector<std::unique_ptr<Membership[]>>().swap(m_pages);
}

} // namespace cadrosim
