#pragma once
// Value sources of members: constants, waveforms, counters and toggles.
#include "Network.h"

#include <random>

namespace cadrosim {
// The member's next value at elapsedMs after the engine started.
SimValue NextValue(const Member &member, double elapsedMs, std::mt19937 &random);
} // namespace cadrosim
