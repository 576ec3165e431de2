#pragma once
// The plain-text network description (see docs/network-file.md) and the
// built-in default network.
#include "Network.h"

#include <string>
#include <vector>

namespace cadrosim {

// Parses a description into out. "$HOST" stands for hostName. On failure,
// error reads "line N: what is wrong".
bool ParseNetworkDescription(const std::wstring &text, const std::wstring &hostName, Network &out, std::wstring &error);

// The network served when no description file is named.
const wchar_t *DefaultNetworkDescription();

// Splits a line at white space; "double quotes" group words. False when a
// quote is not closed.
bool Tokenize(const std::wstring &line, std::vector<std::wstring> &tokens);

// A member from tokens[first] (its name) and the key=value tokens after it.
bool ParseMemberSpec(const std::vector<std::wstring> &tokens, size_t first, Member &member, std::wstring &error);

} // namespace cadrosim
