// CDREALT: real-time subscriptions.
#include "CadroSim.h"

bool NewCadroRealTime(int, ICadroRealTimeReceiver *receiver, CadroRealTime **out)
{
    return CadroSim_NewRealTime(receiver, out);
}
