// opc servers: the OPC DA servers registered on this machine, found through
// the component categories and through the OPC key of their ProgIDs.
#include "Commands.h"
#include "Format.h"

#include <comcat.h>

#include <algorithm>
#include <map>

namespace {
const CATID kDa10 = {0x63d5f430, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
const CATID kDa20 = {0x63d5f432, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};

struct ServerEntry {
    std::wstring progId, vendor, description;
    bool da10 = false, da20 = false;
};

std::wstring GuidText(const GUID &guid)
{
    wchar_t text[40] = {};
    StringFromGUID2(guid, text, 40);
    return text;
}

std::wstring ReadText(const std::wstring &path)
{
    wchar_t data[512] = {};
    DWORD size = sizeof(data) - sizeof(wchar_t);
    if (RegGetValueW(HKEY_CLASSES_ROOT, path.c_str(), nullptr, RRF_RT_REG_SZ, nullptr, data, &size) != ERROR_SUCCESS)
        return L"";
    return data;
}

void AddCategory(ICatInformation *categories, const CATID &category, std::map<std::wstring, ServerEntry> &found)
{
    ComPtr<IEnumCLSID> classes;
    CATID wanted = category;
    if (FAILED(categories->EnumClassesOfCategories(1, &wanted, static_cast<ULONG>(-1), nullptr, classes.Out())) ||
        !classes)
        return;
    CLSID clsid;
    ULONG fetched = 0;
    while (classes->Next(1, &clsid, &fetched) == S_OK && fetched == 1) {
        ServerEntry &entry = found[GuidText(clsid)];
        (IsEqualGUID(category, kDa10) ? entry.da10 : entry.da20) = true;
    }
}

// ProgIDs with an OPC key: the DA 1.0 way of saying "I am an OPC server".
void AddProgIdKeys(std::map<std::wstring, ServerEntry> &found)
{
    wchar_t name[256];
    for (DWORD i = 0;; ++i) {
        DWORD length = 256;
        LONG r = RegEnumKeyExW(HKEY_CLASSES_ROOT, i, name, &length, nullptr, nullptr, nullptr, nullptr);
        if (r == ERROR_NO_MORE_ITEMS)
            break;
        if (r != ERROR_SUCCESS || name[0] == L'.' || name[0] == L'{')
            continue;
        HKEY opc = nullptr;
        if (RegOpenKeyExW(HKEY_CLASSES_ROOT, (std::wstring(name) + L"\\OPC").c_str(), 0, KEY_READ, &opc) !=
            ERROR_SUCCESS)
            continue;
        RegCloseKey(opc);
        CLSID clsid;
        if (SUCCEEDED(CLSIDFromString(ReadText(std::wstring(name) + L"\\CLSID").c_str(), &clsid)))
            found[GuidText(clsid)].da10 = true; // one spelling for every CLSID
    }
}

void Describe(const std::wstring &clsid, ServerEntry &entry)
{
    std::wstring key = L"CLSID\\" + clsid;
    entry.description = ReadText(key);
    std::wstring independent = ReadText(key + L"\\VersionIndependentProgID");
    std::wstring versioned = ReadText(key + L"\\ProgID");
    entry.progId = !independent.empty() ? independent : versioned;
    for (const std::wstring &id : {independent, versioned})
        if (entry.vendor.empty() && !id.empty())
            entry.vendor = ReadText(id + L"\\OPC\\Vendor");
}
} // namespace

int ListServers(const Arguments &args, Output &out)
{
    if (!args.Positional().empty()) {
        out.Error(L"servers takes no arguments");
        return kExitUsage;
    }
    std::map<std::wstring, ServerEntry> found;
    ComPtr<ICatInformation> categories;
    if (SUCCEEDED(CoCreateInstance(CLSID_StdComponentCategoriesMgr, nullptr, CLSCTX_INPROC_SERVER, IID_ICatInformation,
                                   reinterpret_cast<void **>(categories.Out())))) {
        AddCategory(categories.Get(), kDa10, found);
        AddCategory(categories.Get(), kDa20, found);
    }
    AddProgIdKeys(found);

    if (!out.Json() && !found.empty())
        out.Line(L"PROGID                               VERSIONS      VENDOR                CLSID");
    for (auto &pair : found) {
        ServerEntry &entry = pair.second;
        Describe(pair.first, entry);
        std::wstring versions = entry.da10 && entry.da20 ? L"DA 1.0, 2.0" : entry.da20 ? L"DA 2.0" : L"DA 1.0";
        if (out.Json()) {
            std::wstring list = std::wstring(L"[") + (entry.da10 ? L"\"1.0\"" : L"") +
                                (entry.da10 && entry.da20 ? L"," : L"") + (entry.da20 ? L"\"2.0\"" : L"") + L"]";
            out.Line(Output::Object({{L"progId", JsonString(entry.progId)},
                                     {L"clsid", JsonString(pair.first)},
                                     {L"versions", list},
                                     {L"vendor", JsonString(entry.vendor)},
                                     {L"description", JsonString(entry.description)}}));
        } else {
            wchar_t line[512];
            swprintf(line, 512, L"%-36ls %-13ls %-21ls %ls", entry.progId.empty() ? L"-" : entry.progId.c_str(),
                     versions.c_str(), entry.vendor.empty() ? L"-" : entry.vendor.c_str(), pair.first.c_str());
            out.Line(line);
            if (!entry.description.empty())
                out.Line(L"    " + entry.description);
        }
    }
    if (found.empty() && !out.Json())
        out.Line(L"No OPC Data Access server is registered on this machine.");
    return kExitOk;
}
