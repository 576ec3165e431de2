#include "ServerList.h"

#include "ClassCatalog.h"
#include "ComEnum2.h"
#include "ComUtil.h"
#include "TaskMem.h"

namespace {
using CEnumGuid = CComEnum2<IEnumGUID, EnumCopyValue<GUID>>;
using COpcEnumGuid = CComEnum2<IOPCEnumGUID, EnumCopyValue<GUID>>;

// More categories than any registry holds: a count this large is a client's
// mistake, not a question.
constexpr ULONG kMaxCategories = 4096;

// Far beyond the 39 characters a ProgID may have: a string without its end
// in this length is not read further.
constexpr size_t kMaxProgIdLength = 1024;

// A category list the process can read: none, every one (kNotChecked), or
// count readable CATIDs.
bool IsCategoryList(ULONG count, const CATID *categories)
{
    if (count == 0 || count == ClassCatalog::kNotChecked)
        return true;
    return count <= kMaxCategories && IsReadableArray(categories, count);
}

// Clears an out pointer the process can write; false when it cannot (null
// included). Every out pointer is cleared before anything can fail.
bool ClearOut(LPOLESTR *out)
{
    if (!IsWritableOut(out))
        return false;
    *out = nullptr;
    return true;
}

// A copy for the client, or null when out of memory.
LPOLESTR ClientCopy(const std::wstring &text)
{
    return TaskStrDup(text.c_str());
}
} // namespace

HRESULT COPCServerList::Create(IUnknown *outer, REFIID riid, void **ppv)
{
    // Nothing to aggregate for: a plain object is what clients ask for.
    if (outer)
        return CLASS_E_NOAGGREGATION;
    return CreateComObject(NewComObject<COPCServerList>(outer), riid, ppv);
}

void *COPCServerList::FindInterface(REFIID riid)
{
    if (IsEqualIID(riid, IID_IOPCServerList))
        return static_cast<IOPCServerList *>(this);
    if (IsEqualIID(riid, IID_IOPCServerList2))
        return static_cast<IOPCServerList2 *>(this);
    return nullptr;
}

template <class Enumerator> HRESULT COPCServerList::Enumerate(ULONG cImplemented, const CATID *implemented,
                                                              ULONG cRequired, const CATID *required, REFIID riid,
                                                              void **ppenum)
{
    if (!IsWritableOut(ppenum))
        return E_INVALIDARG;
    *ppenum = nullptr;
    if (!IsCategoryList(cImplemented, implemented) || !IsCategoryList(cRequired, required))
        return E_INVALIDARG;
    return ComBoundary([&]() -> HRESULT {
        std::vector<CLSID> classes;
        HRESULT hr = ClassCatalog::ClassesOfCategories(cImplemented, implemented, cRequired, required, classes);
        if (FAILED(hr))
            return hr;
        return Enumerator::Create(std::move(classes), false, riid, ppenum);
    });
}

STDMETHODIMP COPCServerList::EnumClassesOfCategories(ULONG cImplemented, CATID rgcatidImpl[], ULONG cRequired,
                                                     CATID rgcatidReq[], IEnumGUID **ppenumClsid)
{
    return Enumerate<CEnumGuid>(cImplemented, rgcatidImpl, cRequired, rgcatidReq, IID_IEnumGUID,
                                reinterpret_cast<void **>(ppenumClsid));
}

STDMETHODIMP COPCServerList::EnumClassesOfCategories(ULONG cImplemented, CATID rgcatidImpl[], ULONG cRequired,
                                                     CATID rgcatidReq[], IOPCEnumGUID **ppenumClsid)
{
    return Enumerate<COpcEnumGuid>(cImplemented, rgcatidImpl, cRequired, rgcatidReq, IID_IOPCEnumGUID,
                                   reinterpret_cast<void **>(ppenumClsid));
}

HRESULT COPCServerList::Details(REFCLSID clsid, LPOLESTR *progId, LPOLESTR *userType, LPOLESTR *versionIndependent)
{
    return ComBoundary([&]() -> HRESULT {
        ClassCatalog::ClassDetails details;
        HRESULT hr = ClassCatalog::Details(clsid, details);
        if (FAILED(hr))
            return hr;
        // A name the class lacks is an empty string, not a null pointer:
        // clients print these without looking.
        TaskMem<wchar_t> progIdCopy(ClientCopy(details.progId));
        TaskMem<wchar_t> userTypeCopy(ClientCopy(details.userType));
        TaskMem<wchar_t> independentCopy(versionIndependent ? ClientCopy(details.versionIndependentProgId) : nullptr);
        if (!progIdCopy || !userTypeCopy || (versionIndependent && !independentCopy))
            return E_OUTOFMEMORY;
        *progId = progIdCopy.Detach();
        *userType = userTypeCopy.Detach();
        if (versionIndependent)
            *versionIndependent = independentCopy.Detach();
        return S_OK;
    });
}

STDMETHODIMP COPCServerList::GetClassDetails(REFCLSID clsid, LPOLESTR *ppszProgID, LPOLESTR *ppszUserType)
{
    bool outsValid = ClearOut(ppszProgID) & ClearOut(ppszUserType);
    if (!outsValid || !IsReadable(&clsid, sizeof(CLSID)))
        return E_INVALIDARG;
    return Details(clsid, ppszProgID, ppszUserType, nullptr);
}

STDMETHODIMP COPCServerList::GetClassDetails(REFCLSID clsid, LPOLESTR *ppszProgID, LPOLESTR *ppszUserType,
                                             LPOLESTR *ppszVerIndProgID)
{
    bool outsValid = ClearOut(ppszProgID) & ClearOut(ppszUserType) & ClearOut(ppszVerIndProgID);
    if (!outsValid || !IsReadable(&clsid, sizeof(CLSID)))
        return E_INVALIDARG;
    return Details(clsid, ppszProgID, ppszUserType, ppszVerIndProgID);
}

STDMETHODIMP COPCServerList::CLSIDFromProgID(LPCOLESTR szProgId, LPCLSID clsid)
{
    if (!IsWritableOut(clsid))
        return E_INVALIDARG;
    *clsid = CLSID_NULL;
    if (!szProgId || IsBadStringPtrW(szProgId, kMaxProgIdLength) ||
        wcsnlen(szProgId, kMaxProgIdLength) == kMaxProgIdLength)
        return E_INVALIDARG;
    return ComBoundary([&]() -> HRESULT { return ClassCatalog::ClassOfProgId(szProgId, *clsid); });
}
