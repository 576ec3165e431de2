#pragma once
// Item definitions for many identifiers at once, as a client that adds a
// whole plant builds them: active, requested in their canonical types, with
// the index as client handle. The texts stay owned by ids.
#include "opcda.h"

#include <string>
#include <vector>

inline std::vector<OPCITEMDEF> ActiveDefinitions(const std::vector<std::wstring> &ids)
{
    std::vector<OPCITEMDEF> defs(ids.size());
    for (size_t i = 0; i < ids.size(); ++i) {
        defs[i] = {};
        defs[i].szItemID = const_cast<wchar_t *>(ids[i].c_str());
        defs[i].bActive = TRUE;
        defs[i].hClient = static_cast<OPCHANDLE>(i);
    }
    return defs;
}
