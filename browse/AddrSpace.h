#pragma once
// The browsable tree of the Cadro network. Built once, by the first server
// object, and kept until the process ends.
#include <windows.h>

class CAddrSpace {
public:
    static CAddrSpace *Create();
    HRESULT Build();

private:
    CAddrSpace() = default;
};
