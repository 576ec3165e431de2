// CDBROW: browsing the network.
#include "CadroSim.h"

bool NewCadroBrowser(int, ICadroBrowserReceiver *receiver, CadroBrowser **out)
{
    return CadroSim_NewBrowser(receiver, out);
}
