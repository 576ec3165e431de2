#include "AddrSpace.h"

#include "Trace.h"

#include <new>

CAddrSpace *CAddrSpace::Create()
{
    return new (std::nothrow) CAddrSpace();
}

HRESULT CAddrSpace::Build()
{
    // The root URLs and the tree arrive with browsing.
    Trace("address space built\n");
    return S_OK;
}
