#pragma once
// The browse filter: "?" any character, "*" any run, "#" a digit, "[...]" a
// character list with ranges, "[!...]" an excluded list; anything else
// itself. Case-sensitive, on 8-bit text in the system code page, characters
// compared as signed values.
#include <string>

bool MatchPattern(const std::string &name, const std::string &pattern);
// Both texts converted to 8-bit text through the system code page first.
bool MatchPattern(const std::wstring &name, const std::wstring &pattern);
