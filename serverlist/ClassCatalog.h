#pragma once
// What this machine's registry says about its COM classes: which implement
// which component categories, and their names.
#include <comcat.h>

#include <string>
#include <vector>

namespace ClassCatalog {
// A count of categories that means: not checked (either list).
constexpr ULONG kNotChecked = static_cast<ULONG>(-1);

// The classes that implement any of implemented[0..implementedCount) and
// require nothing beyond required[0..requiredCount) (kNotChecked: not
// checked), as the component categories manager finds them. When OPC DA 1.0
// is asked for and no required category is named, the classes of ProgIDs
// that carry an OPC key come too: DA 1.0 servers predate the categories.
// No class is listed twice.
HRESULT ClassesOfCategories(ULONG implementedCount, const CATID *implemented, ULONG requiredCount,
                            const CATID *required, std::vector<CLSID> &classes);

struct ClassDetails {
    std::wstring progId;                   // empty when the class has none
    std::wstring userType;                 // the class key's default value
    std::wstring versionIndependentProgId; // empty when the class has none
};
// REGDB_E_CLASSNOTREG when the class has no key.
HRESULT Details(REFCLSID clsid, ClassDetails &details);

// The class of a ProgID (a version-independent one too, through its CurVer);
// REGDB_E_CLASSNOTREG when the ProgID names no class.
HRESULT ClassOfProgId(const wchar_t *progId, CLSID &clsid);
} // namespace ClassCatalog
