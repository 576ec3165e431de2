#pragma once
// Interpreter of the registration scripts carried as "REGISTRY" resources.
// Each line is a key or a named value under HKEY_CLASSES_ROOT (see
// registry/appid.rgs for the language).
#include <windows.h>

#include <string>
#include <vector>

class CRegistryScript {
public:
    enum class KeyFlag { Plain, NoRemove, ForceRemove };
    struct Record {
        bool isValue = false;
        KeyFlag flag = KeyFlag::Plain;
        std::wstring path;    // key path
        std::wstring name;    // value name (named values only)
        bool hasData = false; // a key's default value is given
        std::wstring data;    // after substitution
    };

    // Parses text; %MODULE% becomes modulePath. False on a malformed line.
    bool Parse(const std::string &text, const std::wstring &modulePath);
    const std::vector<Record> &Records() const { return m_records; }

    HRESULT Register(HKEY root = HKEY_CLASSES_ROOT) const;
    // Removal reports nothing: missing keys are skipped.
    void Unregister(HKEY root = HKEY_CLASSES_ROOT) const;

    // Loads and parses the script resource id of the running executable.
    static HRESULT Load(int id, const std::wstring &modulePath, CRegistryScript &script);

private:
    std::vector<Record> m_records;
};
