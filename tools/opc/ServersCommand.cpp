// opc servers: the OPC DA servers registered on a machine. They are asked of
// the machine's server list object when one is registered (always for
// another machine); without one, this machine's component categories and the
// OPC keys of its ProgIDs are read here.
#include "ClassCatalog.h"
#include "Commands.h"
#include "Format.h"
#include "RegistryText.h"
#include "ServerListIds.h"
#include "opccomn.h"

#include <comcat.h>

#include <map>
#include <vector>

namespace {
const CATID kDa10 = {0x63d5f430, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
const CATID kDa20 = {0x63d5f432, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};

struct ServerEntry {
    std::wstring progId, vendor, description;
    bool da10 = false, da20 = false;
};
using ServerMap = std::map<std::wstring, ServerEntry>;

using RegistryText::GuidText;

void Mark(ServerMap &found, const CLSID &clsid, const CATID &category)
{
    ServerEntry &entry = found[GuidText(clsid)]; // one spelling for every CLSID
    (IsEqualGUID(category, kDa10) ? entry.da10 : entry.da20) = true;
}

// The names of a class; the vendor only where this machine's registry has
// it (the list does not tell it).
void Describe(ServerEntry &entry, const std::wstring &versioned, const std::wstring &independent,
              const std::wstring &userType, bool local)
{
    entry.description = userType;
    entry.progId = !independent.empty() ? independent : versioned;
    for (const std::wstring &id : {independent, versioned})
        if (local && entry.vendor.empty() && !id.empty())
            entry.vendor = RegistryText::Read(id + L"\\OPC\\Vendor");
}

// This machine's registry, read here as a server list reads it.
void FromRegistry(ServerMap &found)
{
    for (const CATID &category : {kDa10, kDa20}) {
        std::vector<CLSID> classes;
        ClassCatalog::ClassesOfCategories(1, &category, 0, nullptr, classes);
        for (const CLSID &clsid : classes)
            Mark(found, clsid, category);
    }
    for (auto &pair : found) {
        CLSID clsid;
        ClassCatalog::ClassDetails details;
        if (SUCCEEDED(CLSIDFromString(pair.first.c_str(), &clsid)) && SUCCEEDED(ClassCatalog::Details(clsid, details)))
            Describe(pair.second, details.progId, details.versionIndependentProgId, details.userType, true);
    }
}

// Takes over a string the list allocated.
std::wstring TakeString(LPOLESTR text)
{
    std::wstring copy = text ? text : L"";
    CoTaskMemFree(text);
    return copy;
}

template <class Enumerator> HRESULT AddClasses(Enumerator *classes, const CATID &category, ServerMap &found)
{
    CLSID batch[64];
    for (;;) {
        ULONG fetched = 0;
        HRESULT hr = classes->Next(64, batch, &fetched);
        if (FAILED(hr))
            return hr;
        for (ULONG i = 0; i < fetched && i < 64; ++i)
            Mark(found, batch[i], category);
        if (hr != S_OK || fetched == 0)
            return S_OK;
    }
}

// Through IOPCServerList2 when the list has it, else through IOPCServerList.
HRESULT FromServerList(IUnknown *list, bool local, ServerMap &found)
{
    ComPtr<IOPCServerList2> list2;
    ComPtr<IOPCServerList> list1;
    ComPtr<IUnknown>(list).As(list2);
    if (!list2 && FAILED(ComPtr<IUnknown>(list).As(list1)))
        return E_NOINTERFACE;
    for (const CATID &category : {kDa10, kDa20}) {
        CATID wanted = category;
        HRESULT hr;
        if (list2) {
            ComPtr<IOPCEnumGUID> classes;
            hr = list2->EnumClassesOfCategories(1, &wanted, 0, nullptr, classes.Out());
            if (SUCCEEDED(hr) && classes)
                hr = AddClasses(classes.Get(), category, found);
        } else {
            ComPtr<IEnumGUID> classes;
            hr = list1->EnumClassesOfCategories(1, &wanted, 0, nullptr, classes.Out());
            if (SUCCEEDED(hr) && classes)
                hr = AddClasses(classes.Get(), category, found);
        }
        if (FAILED(hr))
            return hr;
    }
    for (auto &pair : found) {
        CLSID clsid;
        CLSIDFromString(pair.first.c_str(), &clsid);
        LPOLESTR progId = nullptr, userType = nullptr, independent = nullptr;
        HRESULT hr = list2 ? list2->GetClassDetails(clsid, &progId, &userType, &independent)
                           : list1->GetClassDetails(clsid, &progId, &userType);
        std::wstring versioned = TakeString(progId), type = TakeString(userType), free = TakeString(independent);
        if (SUCCEEDED(hr))
            Describe(pair.second, versioned, free, type, local);
    }
    return S_OK;
}

bool ServerListRegistered()
{
    return RegistryText::KeyExists(L"CLSID\\" + GuidText(CLSID_OPCServerList));
}

// The names of this machine that a --host may give.
bool IsThisMachine(const std::wstring &host)
{
    if (host.empty() || _wcsicmp(host.c_str(), L"localhost") == 0 || host == L"." || host == L"127.0.0.1" ||
        host == L"::1")
        return true;
    for (COMPUTER_NAME_FORMAT format : {ComputerNameNetBIOS, ComputerNameDnsHostname, ComputerNameDnsFullyQualified}) {
        wchar_t name[256] = {};
        DWORD size = 256;
        if (GetComputerNameExW(format, name, &size) && _wcsicmp(name, host.c_str()) == 0)
            return true;
    }
    return false;
}

void Print(ServerMap &found, const std::wstring &where, Output &out)
{
    if (!out.Json() && !found.empty())
        out.Line(L"PROGID                               VERSIONS      VENDOR                CLSID");
    for (auto &pair : found) {
        ServerEntry &entry = pair.second;
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
        out.Line(L"No OPC Data Access server is registered on " + where + L".");
}
} // namespace

int ListServers(const Arguments &args, Output &out)
{
    if (!args.Positional().empty()) {
        out.Error(L"servers takes no arguments");
        return kExitUsage;
    }
    double timeout = kDefaultTimeoutSeconds;
    if (args.Has(L"timeout"))
        ParseNumber(args.Value(L"timeout"), 1, 86400, timeout); // checked before
    const std::wstring host = args.Value(L"host");
    const bool local = IsThisMachine(host);
    ServerMap found;
    HRESULT hr = S_FALSE; // not asked
    if (!local || ServerListRegistered()) {
        ComPtr<IUnknown> list;
        hr = CreateOutOfProcess(CLSID_OPCServerList, IID_IUnknown, local ? L"" : host, timeout, list);
        if (SUCCEEDED(hr))
            hr = FromServerList(list.Get(), local, found);
    }
    if (FAILED(hr) && !local) {
        out.Error(L"cannot reach the OPC server list of \"" + host + L"\": " +
                  (hr == E_PENDING ? L"no answer within " + std::to_wstring(static_cast<long>(timeout)) + L" s"
                                   : SystemErrorText(hr) + L" (" + HexCode(hr) + L")"));
        return kExitNoServer;
    }
    if (hr != S_OK) {
        // No list here, or one that failed: this machine's registry says the same.
        found.clear();
        FromRegistry(found);
    }
    Print(found, host.empty() ? L"this machine" : host, out);
    return kExitOk;
}
