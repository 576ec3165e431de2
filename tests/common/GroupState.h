#pragma once
// A group's state read through IOPCGroupStateMgt in one call, for tests and
// benchmarks alike (no test framework here).
#include "opcda.h"

#include <string>

struct GroupState {
    HRESULT hr = E_FAIL;
    DWORD rate = 0;
    BOOL active = FALSE;
    std::wstring name;
    LONG bias = 0;
    FLOAT deadband = 0;
    DWORD lcid = 0;
    OPCHANDLE client = 0;
    OPCHANDLE server = 0;
};

inline GroupState StateOf(IOPCGroupStateMgt *group)
{
    GroupState s;
    LPWSTR name = nullptr;
    s.hr = group->GetState(&s.rate, &s.active, &name, &s.bias, &s.deadband, &s.lcid, &s.client, &s.server);
    if (name) {
        s.name = name;
        CoTaskMemFree(name);
    }
    return s;
}
