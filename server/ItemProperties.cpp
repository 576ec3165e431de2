#include "ItemProperties.h"

#include "ItemIdChecker.h"

namespace {
const PropertyRecord kProperties[] = {
    {1, VT_I2, L"Item Canonical Data Type"},
    {2, VT_VARIANT, L"Item Value"},
    {3, VT_I2, L"Item Quality"},
    {4, VT_DATE, L"Item TimeStamp"},
    {5, VT_I4, L"Item Access Rights"},
    {6, VT_R4, L"Server Scan Rate"},
    {100, VT_BSTR, L"EU Units"},
    {101, VT_BSTR, L"Item Description"},
    {102, VT_R8, L"High EU"},
    {103, VT_R8, L"Low EU"},
    {104, VT_R8, L"High Instrument Range"},
    {105, VT_R8, L"Low Instrument Range"},
    {106, VT_BSTR, L"Contact Close Label"},
    {107, VT_BSTR, L"Contact Open Label"},
    {108, VT_I4, L"Item Timezone"},
    {200, VT_BSTR, L"Default Display"},
    {201, VT_I4, L"Current Foreground Color"},
    {202, VT_I4, L"Current Background Color"},
    {203, VT_BOOL, L"Current Blink"},
    {204, VT_BSTR, L"BMP File"},
    {205, VT_BSTR, L"Sound File"},
    {206, VT_BSTR, L"HTML File"},
    {207, VT_BSTR, L"AVI File"},
};
} // namespace

const PropertyRecord *FindProperty(DWORD id)
{
    for (const PropertyRecord &p : kProperties)
        if (p.id == id)
            return &p;
    return nullptr;
}

ItemKind ClassifyItem(CAddrSpace *space, const wchar_t *itemId, AddrNodePtr &node)
{
    // Without an address space (its build failed) nothing is known to it.
    node = space ? space->FindByItemId(itemId) : nullptr;
    if (node)
        return node->IsBranch() ? ItemKind::KnownBranch : ItemKind::KnownItem;
    return SUCCEEDED(CheckItemIdentifier(itemId)) ? ItemKind::Unlisted : ItemKind::Invalid;
}
