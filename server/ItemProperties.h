#pragma once
// The item properties the server offers: the standard's property table (of
// which 1 to 6 and 101 are served) and the kinds of item identifier.
#include "AddrSpace.h"

#include <oaidl.h>

struct PropertyRecord {
    DWORD id;
    VARTYPE type;
    const wchar_t *description;
};

// The record of a property identifier, or null.
const PropertyRecord *FindProperty(DWORD id);

enum class ItemKind { KnownItem, KnownBranch, Unlisted, Invalid };
// Decided afresh by every call: the address space first, then the syntax.
ItemKind ClassifyItem(CAddrSpace *space, const wchar_t *itemId, AddrNodePtr &node);
