#include "RegistryScript.h"

#include <sstream>

namespace {
std::wstring Widen(const std::string &s)
{
    // Scripts are ASCII; the module path is substituted as wide text.
    return std::wstring(s.begin(), s.end());
}

std::wstring Substitute(std::wstring text, const std::wstring &modulePath)
{
    const std::wstring token = L"%MODULE%";
    for (size_t at = text.find(token); at != std::wstring::npos; at = text.find(token, at + modulePath.size()))
        text.replace(at, token.size(), modulePath);
    return text;
}

// The quoted text after "=" on a line, if any.
bool QuotedData(const std::string &line, std::string &data)
{
    size_t eq = line.find('=');
    if (eq == std::string::npos)
        return false;
    size_t open = line.find('\'', eq);
    size_t close = line.rfind('\'');
    if (open == std::string::npos || close == open)
        throw false;
    data = line.substr(open + 1, close - open - 1);
    return true;
}

HRESULT SetString(HKEY key, const wchar_t *name, const std::wstring &data)
{
    LONG rc = RegSetValueExW(key, name, 0, REG_SZ, reinterpret_cast<const BYTE *>(data.c_str()),
                             static_cast<DWORD>((data.size() + 1) * sizeof(wchar_t)));
    return HRESULT_FROM_WIN32(rc);
}
void DeleteKeyTree(HKEY root, const std::wstring &path)
{
    RegDeleteTreeW(root, path.c_str()); // empties the key
    RegDeleteKeyW(root, path.c_str());
}
} // namespace

bool CRegistryScript::Parse(const std::string &text, const std::wstring &modulePath)
{
    m_records.clear();
    std::istringstream lines(text);
    std::string line;
    try {
        while (std::getline(lines, line)) {
            if (!line.empty() && line.back() == '\r')
                line.pop_back();
            std::istringstream words(line);
            std::string kind, word;
            if (!(words >> kind) || kind[0] == ';')
                continue;
            Record record;
            std::string data;
            if (kind == "key") {
                words >> word;
                if (word == "NoRemove" || word == "ForceRemove") {
                    record.flag = word == "NoRemove" ? KeyFlag::NoRemove : KeyFlag::ForceRemove;
                    words >> word;
                }
                record.path = Widen(word);
                record.hasData = QuotedData(line, data);
            } else if (kind == "value") {
                std::string name;
                words >> word >> name;
                record.isValue = true;
                record.path = Widen(word);
                record.name = Widen(name);
                record.hasData = QuotedData(line, data);
                if (!record.hasData || name.empty())
                    return false;
            } else {
                return false;
            }
            if (record.path.empty())
                return false;
            record.data = Substitute(Widen(data), modulePath);
            m_records.push_back(std::move(record));
        }
    } catch (bool) {
        return false;
    }
    return true;
}

HRESULT CRegistryScript::Register(HKEY root) const
{
    for (const Record &r : m_records) {
        if (!r.isValue && r.flag == KeyFlag::ForceRemove)
            DeleteKeyTree(root, r.path);
        HKEY key;
        LONG rc = RegCreateKeyExW(root, r.path.c_str(), 0, nullptr, 0, KEY_READ | KEY_WRITE, nullptr, &key, nullptr);
        if (rc != ERROR_SUCCESS)
            return HRESULT_FROM_WIN32(rc);
        HRESULT hr = S_OK;
        if (r.hasData)
            hr = SetString(key, r.isValue ? r.name.c_str() : nullptr, r.data);
        RegCloseKey(key);
        if (FAILED(hr))
            return hr;
    }
    return S_OK;
}

void CRegistryScript::Unregister(HKEY root) const
{
    for (auto it = m_records.rbegin(); it != m_records.rend(); ++it) {
        const Record &r = *it;
        if (r.isValue) {
            RegDeleteKeyValueW(root, r.path.c_str(), r.name.c_str());
        } else if (r.flag != KeyFlag::NoRemove) {
            // A plain key is the server's own: it goes with anything left
            // below it (the implemented-category keys, for instance, are
            // unregistered only after the scripts).
            DeleteKeyTree(root, r.path);
        }
    }
}

HRESULT CRegistryScript::Load(int id, const std::wstring &modulePath, CRegistryScript &script)
{
    HMODULE module = GetModuleHandleW(nullptr);
    HRSRC found = FindResourceW(module, MAKEINTRESOURCEW(id), L"REGISTRY");
    if (!found)
        return HRESULT_FROM_WIN32(GetLastError());
    HGLOBAL loaded = LoadResource(module, found);
    const char *bytes = loaded ? static_cast<const char *>(LockResource(loaded)) : nullptr;
    if (!bytes)
        return HRESULT_FROM_WIN32(GetLastError());
    std::string text(bytes, SizeofResource(module, found));
    return script.Parse(text, modulePath) ? S_OK : HRESULT_FROM_WIN32(ERROR_BAD_FORMAT);
}
