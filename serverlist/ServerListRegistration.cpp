#include "ServerListRegistration.h"

#include "RegistryText.h"
#include "ServerListIds.h"

#include <objbase.h>
#include <olectl.h>

#include <cwctype>

namespace {
const wchar_t kDescription[] = L"OPC Server List";
const wchar_t kProgId[] = L"OPC.ServerList.1";
const wchar_t kIndependentProgId[] = L"OPC.ServerList";

using RegistryText::GuidText;
using RegistryText::KeyExists;

std::wstring ClassKey()
{
    return L"CLSID\\" + GuidText(CLSID_OPCServerList);
}

bool WriteText(const std::wstring &path, const wchar_t *value, const std::wstring &text)
{
    HKEY key = nullptr;
    if (RegCreateKeyExW(HKEY_CLASSES_ROOT, path.c_str(), 0, nullptr, 0, KEY_WRITE, nullptr, &key, nullptr) !=
        ERROR_SUCCESS)
        return false;
    LONG r = RegSetValueExW(key, value, 0, REG_SZ, reinterpret_cast<const BYTE *>(text.c_str()),
                            static_cast<DWORD>((text.size() + 1) * sizeof(wchar_t)));
    RegCloseKey(key);
    return r == ERROR_SUCCESS;
}

std::wstring Lower(std::wstring text)
{
    for (wchar_t &c : text)
        c = static_cast<wchar_t>(std::towlower(c));
    return text;
}

// The file name of the program a LocalServer32 command line starts, in
// lower case: quoted, or up to its ".exe".
std::wstring ProgramName(const std::wstring &commandLine)
{
    std::wstring path = commandLine;
    if (!path.empty() && path[0] == L'"') {
        size_t end = path.find(L'"', 1);
        path = path.substr(1, end == std::wstring::npos ? std::wstring::npos : end - 1);
    } else {
        size_t exe = Lower(path).find(L".exe");
        if (exe != std::wstring::npos)
            path.resize(exe + 4);
    }
    size_t slash = path.find_last_of(L"\\/");
    return Lower(slash == std::wstring::npos ? path : path.substr(slash + 1));
}

// Another installation's server list: the class key exists and does not
// start this executable.
bool RegisteredElsewhere(const std::wstring &exePath)
{
    if (!KeyExists(ClassKey()))
        return false;
    std::wstring server = RegistryText::Read(ClassKey() + L"\\LocalServer32");
    return server.empty() || ProgramName(server) != ProgramName(exePath);
}

// A ProgID key is ours to write or remove when it is absent or names the
// server list class.
bool ProgIdIsOurs(const wchar_t *progId)
{
    if (!KeyExists(progId))
        return true;
    CLSID clsid;
    std::wstring text = RegistryText::Read(std::wstring(progId) + L"\\CLSID");
    return !text.empty() && SUCCEEDED(CLSIDFromString(text.c_str(), &clsid)) &&
           IsEqualCLSID(clsid, CLSID_OPCServerList);
}

std::wstring ExeName(const std::wstring &exePath)
{
    size_t slash = exePath.find_last_of(L"\\/");
    return slash == std::wstring::npos ? exePath : exePath.substr(slash + 1);
}
} // namespace

namespace ServerListRegistration {
HRESULT Register(const std::wstring &exePath)
{
    if (RegisteredElsewhere(exePath))
        return S_FALSE;
    const std::wstring clsid = GuidText(CLSID_OPCServerList);
    const std::wstring key = ClassKey();
    bool ok = WriteText(key, nullptr, kDescription) && WriteText(key, L"AppID", clsid) &&
              WriteText(key + L"\\LocalServer32", nullptr, L"\"" + exePath + L"\"") &&
              WriteText(L"AppID\\" + clsid, nullptr, kDescription) &&
              WriteText(L"AppID\\" + ExeName(exePath), L"AppID", clsid);
    // The ProgIDs are written only where no other class holds them.
    if (ok && ProgIdIsOurs(kProgId) && ProgIdIsOurs(kIndependentProgId)) {
        ok = WriteText(key + L"\\ProgID", nullptr, kProgId) &&
             WriteText(key + L"\\VersionIndependentProgID", nullptr, kIndependentProgId) &&
             WriteText(kProgId, nullptr, kDescription) &&
             WriteText(std::wstring(kProgId) + L"\\CLSID", nullptr, clsid) &&
             WriteText(kIndependentProgId, nullptr, kDescription) &&
             WriteText(std::wstring(kIndependentProgId) + L"\\CLSID", nullptr, clsid) &&
             WriteText(std::wstring(kIndependentProgId) + L"\\CurVer", nullptr, kProgId);
    }
    return ok ? S_OK : SELFREG_E_CLASS;
}

HRESULT Unregister(const std::wstring &exePath)
{
    if (!KeyExists(ClassKey()) || RegisteredElsewhere(exePath))
        return S_FALSE;
    for (const wchar_t *progId : {kProgId, kIndependentProgId})
        if (KeyExists(progId) && ProgIdIsOurs(progId))
            RegDeleteTreeW(HKEY_CLASSES_ROOT, progId);
    RegDeleteTreeW(HKEY_CLASSES_ROOT, (L"AppID\\" + ExeName(exePath)).c_str());
    RegDeleteTreeW(HKEY_CLASSES_ROOT, (L"AppID\\" + GuidText(CLSID_OPCServerList)).c_str());
    RegDeleteTreeW(HKEY_CLASSES_ROOT, ClassKey().c_str());
    return S_OK;
}
} // namespace ServerListRegistration
