#pragma once
// Reading the class records under HKEY_CLASSES_ROOT.
#include <windows.h>

#include <string>

namespace RegistryText {
// A REG_SZ value of HKEY_CLASSES_ROOT\path (value null: the default), or
// empty when it is missing.
std::wstring Read(const std::wstring &path, const wchar_t *value = nullptr);
bool KeyExists(const std::wstring &path);
// "{XXXXXXXX-XXXX-XXXX-XXXX-XXXXXXXXXXXX}"
std::wstring GuidText(const GUID &guid);
} // namespace RegistryText
