#include "ClassCatalog.h"

#include "ComPtr.h"
#include "RegistryText.h"

#include <algorithm>

namespace {
const CATID kOpcDa10 = {0x63d5f430, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};

using RegistryText::GuidText;
using RegistryText::KeyExists;

void AddOnce(std::vector<CLSID> &classes, const CLSID &clsid)
{
    if (std::none_of(classes.begin(), classes.end(), [&](const CLSID &c) { return IsEqualCLSID(c, clsid); }))
        classes.push_back(clsid);
}

void AddCategorised(ULONG implementedCount, const CATID *implemented, ULONG requiredCount, const CATID *required,
                    std::vector<CLSID> &classes)
{
    ComPtr<ICatInformation> categories;
    if (FAILED(CoCreateInstance(CLSID_StdComponentCategoriesMgr, nullptr, CLSCTX_INPROC_SERVER, IID_ICatInformation,
                                reinterpret_cast<void **>(categories.Out()))))
        return;
    ComPtr<IEnumCLSID> found;
    if (FAILED(categories->EnumClassesOfCategories(implementedCount, const_cast<CATID *>(implemented), requiredCount,
                                                   const_cast<CATID *>(required), found.Out())) ||
        !found)
        return;
    CLSID clsid;
    ULONG fetched = 0;
    while (found->Next(1, &clsid, &fetched) == S_OK && fetched == 1)
        AddOnce(classes, clsid);
}

// ProgIDs with an OPC key: the DA 1.0 way of saying "I am an OPC server".
void AddOpcProgIds(std::vector<CLSID> &classes)
{
    wchar_t name[256];
    for (DWORD i = 0;; ++i) {
        DWORD length = 256;
        LONG r = RegEnumKeyExW(HKEY_CLASSES_ROOT, i, name, &length, nullptr, nullptr, nullptr, nullptr);
        if (r == ERROR_NO_MORE_ITEMS)
            break;
        if (r != ERROR_SUCCESS || name[0] == L'.' || name[0] == L'{' || !KeyExists(std::wstring(name) + L"\\OPC"))
            continue;
        CLSID clsid;
        std::wstring text = RegistryText::Read(std::wstring(name) + L"\\CLSID");
        if (!text.empty() && SUCCEEDED(CLSIDFromString(text.c_str(), &clsid)))
            AddOnce(classes, clsid);
    }
}
} // namespace

namespace ClassCatalog {
HRESULT ClassesOfCategories(ULONG implementedCount, const CATID *implemented, ULONG requiredCount,
                            const CATID *required, std::vector<CLSID> &classes)
{
    classes.clear();
    AddCategorised(implementedCount, implemented, requiredCount, required, classes);
    bool nothingRequired = requiredCount == 0 || requiredCount == kNotChecked;
    bool da10 = implemented && implementedCount != kNotChecked &&
                std::any_of(implemented, implemented + implementedCount,
                            [](const CATID &c) { return IsEqualGUID(c, kOpcDa10); });
    if (da10 && nothingRequired)
        AddOpcProgIds(classes);
    return S_OK;
}

HRESULT Details(REFCLSID clsid, ClassDetails &details)
{
    std::wstring key = L"CLSID\\" + GuidText(clsid);
    if (!KeyExists(key))
        return REGDB_E_CLASSNOTREG;
    details.userType = RegistryText::Read(key);
    details.progId = RegistryText::Read(key + L"\\ProgID");
    details.versionIndependentProgId = RegistryText::Read(key + L"\\VersionIndependentProgID");
    return S_OK;
}

HRESULT ClassOfProgId(const wchar_t *progId, CLSID &clsid)
{
    // Only a ProgID: CLSIDFromProgID would also take a "{...}" string.
    if (!progId || !*progId || progId[0] == L'{')
        return REGDB_E_CLASSNOTREG;
    return SUCCEEDED(CLSIDFromProgID(progId, &clsid)) ? S_OK : REGDB_E_CLASSNOTREG;
}
} // namespace ClassCatalog
