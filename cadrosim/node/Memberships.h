#pragma once
// A library's subscriptions on the node, by the slots of their ids: the
// feed each one has joined and its place among the feed's members. A
// library's slots are dense, so they are kept in pages of an array, eight
// bytes a subscription (a hash table by id took about thirty); a page is
// made when a slot of it is first used, so that an id far out costs one page,
// not a table that size.
#include <cstdint>
#include <memory>
#include <vector>

namespace cadrosim {

struct Membership {
    uint32_t feed = 0;  // the feed's id; 0: the slot is free
    uint32_t index = 0; // in the feed's members
};

class Memberships {
public:
    // The entry of the id's slot, or null when no page holds it. Which id
    // has the slot, the feed's members say.
    Membership *AtSlotOf(uint32_t id);
    // The same, the page made when needed; null for an id without a slot.
    // Throws std::bad_alloc, nothing changed, when memory is short.
    Membership *PlaceSlotOf(uint32_t id);
    // Forgets every entry and gives the pages back.
    void Clear();

private:
    static constexpr uint32_t kPageBits = 10;
    static constexpr uint32_t kPageSize = 1u << kPageBits;
    std::vector<std::unique_ptr<Membership[]>> m_pages;
};

} // namespace cadrosim
