#pragma once
// A member's value inside the simulator, and its conversions to and from the
// network's CadroValue record and text.
#include "CadroNetwork.h"

#include <string>

namespace cadrosim {

struct SimValue {
    uint32_t type = kCadroCleared; // network data type
    double number = 0.0;           // booleans: 0 or 1
    std::wstring text;

    static SimValue Number(uint32_t type, double n);
    static SimValue Text(uint32_t type, std::wstring s);
    bool operator==(const SimValue &o) const { return type == o.type && number == o.number && text == o.text; }
};

// Network data type from its name in descriptions and commands ("bool",
// "number", "text", "wtext", "none"); 0 when unknown.
uint32_t TypeFromName(const std::wstring &name);
const wchar_t *TypeName(uint32_t type);

// Parses literal as a value of the given network type.
bool ParseValue(uint32_t type, const std::wstring &literal, SimValue &out);
std::wstring FormatValue(const SimValue &value);
// A generated number in the member's type (booleans: non-zero is true).
SimValue FromNumber(uint32_t type, double n);

// Fills record with a new reference to any text object; the caller clears it
// with ClearCadroValue.
bool ToCadroValue(const SimValue &value, CadroValue &record);
void ClearCadroValue(CadroValue &record);
// The characters of a text record (narrow ones widened); false when its
// object is not the text its type says.
bool TextOf(const CadroValue &record, std::wstring &out);
// Converts a written record into the member's type; false when it cannot.
bool FromCadroValue(const CadroValue &record, uint32_t memberType, SimValue &out);

} // namespace cadrosim
