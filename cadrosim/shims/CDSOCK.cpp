// CDSOCK: the local host name.
#include "CadroSim.h"

HRESULT GetHostMachineName(BSTR *out)
{
    return CadroSim_HostName(out);
}
