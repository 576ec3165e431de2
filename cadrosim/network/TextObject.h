#pragma once
// Reference-counted text objects carried by text values: wide (UTF-16) or
// narrow (ANSI code page) characters.
#include "CadroNetwork.h"

#include <string>

namespace cadrosim {
// A new wide text object with one reference.
IUnknown *NewWideText(const std::wstring &text);
// A new narrow text object with one reference.
IUnknown *NewNarrowText(const std::string &text);
} // namespace cadrosim
