#pragma once
// The registry records of the server list class. The class has one CLSID on
// every machine, and a machine with the standard OPC installation already
// has a server list: this executable never takes it over. It registers the
// class only when no other executable is registered for it, and removes
// only records that name this executable (a copy of this executable at
// another path counts as this one: an installation that moved).
#include <windows.h>

#include <string>

namespace ServerListRegistration {
// S_OK: the records name exePath now; S_FALSE: another server list is
// registered and was left as it is.
HRESULT Register(const std::wstring &exePath);
// S_OK: the records are gone; S_FALSE: the class belongs to another server
// list, or nothing was registered, and the registry is untouched.
HRESULT Unregister(const std::wstring &exePath);
} // namespace ServerListRegistration
