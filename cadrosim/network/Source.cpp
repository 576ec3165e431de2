#include "Source.h"

#include <cmath>

namespace cadrosim {

SimValue NextValue(const Member &member, double elapsedMs, std::mt19937 &random)
{
    const Source &s = member.source;
    const double pi = 3.14159265358979323846;
    double phase = std::fmod(elapsedMs, s.cycle) / s.cycle; // 0 .. 1
    double n = member.value.number;
    switch (s.kind) {
    case SourceKind::Const:
        return member.value;
    case SourceKind::Sine:
        n = s.offset + s.amplitude * std::sin(2 * pi * phase);
        break;
    case SourceKind::Cosine:
        n = s.offset + s.amplitude * std::cos(2 * pi * phase);
        break;
    case SourceKind::Ramp:
        n = s.min + (s.max - s.min) * phase;
        break;
    case SourceKind::Square:
        n = phase < 0.5 ? s.max : s.min;
        break;
    case SourceKind::Random:
        n = std::uniform_real_distribution<double>(s.min, s.max)(random);
        break;
    case SourceKind::Counter:
        if (member.type == kCadroNarrowText || member.type == kCadroWideText)
            n = std::wcstod(member.value.text.c_str(), nullptr);
        n += s.step;
        break;
    case SourceKind::Toggle:
        n = n != 0 ? 0 : 1;
        break;
    }
    return FromNumber(member.type, n);
}

} // namespace cadrosim
