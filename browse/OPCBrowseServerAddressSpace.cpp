#include "OPCBrowseServerAddressSpace.h"

#include "CallPass.h"
#include "ComEnum2.h"
#include "ComUtil.h"
#include "OpcErrors.h"
#include "PatternMatch.h"
#include "TaskMem.h"
#include "Trace.h"
#include "ValueConversion.h"

#include <algorithm>

HRESULT COPCBrowseServerAddressSpace::Create(CAddrSpace *space, REFIID riid, void **ppv)
{
    auto *browse = NewComObject<COPCBrowseServerAddressSpace>();
    if (!browse)
        return E_OUTOFMEMORY;
    browse->m_space = space;
    browse->m_position = space->Root();
    return CreateComObject(browse, riid, ppv);
}

COPCBrowseServerAddressSpace::~COPCBrowseServerAddressSpace()
{
    Trace("COPCBrowseServerAddressSpace destructing\n");
}

void *COPCBrowseServerAddressSpace::FindInterface(REFIID riid)
{
    return IsEqualIID(riid, IID_IOPCBrowseServerAddressSpace) ? static_cast<IOPCBrowseServerAddressSpace *>(this)
                                                              : nullptr;
}

STDMETHODIMP COPCBrowseServerAddressSpace::QueryOrganization(OPCNAMESPACETYPE *pNameSpaceType)
{
    if (!IsWritableOut(pNameSpaceType))
        return E_INVALIDARG;
    *pNameSpaceType = static_cast<OPCNAMESPACETYPE>(m_space->Organization());
    return S_OK;
}

STDMETHODIMP COPCBrowseServerAddressSpace::ChangeBrowsePosition(OPCBROWSEDIRECTION dwBrowseDirection, LPCWSTR szString)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        CSingleLock lock(&m_space->Lock());
        switch (dwBrowseDirection) {
        case OPC_BROWSE_UP: {
            AddrNodePtr parent = m_position->Parent();
            if (m_position->IsRoot() || !parent)
                return E_FAIL;
            m_position = parent;
            return S_OK;
        }
        case OPC_BROWSE_DOWN: {
            if (!szString || !*szString)
                return E_INVALIDARG;
            if (FAILED(m_space->Refresh(m_position)))
                return E_FAIL;
            AddrNodePtr child;
            for (const AddrNodePtr &c : m_position->IsBranch() ? *m_position->Children() : std::vector<AddrNodePtr>())
                if (c->DisplayName() == szString) {
                    child = c;
                    break;
                }
            if (!child)
                return E_FAIL;
            m_position = child;
            return S_OK;
        }
        case OPC_BROWSE_TO: {
            if (!szString || !*szString) {
                m_position = m_space->Root();
                return S_OK;
            }
            AddrNodePtr node = m_space->FindByItemId(szString);
            if (!node)
                return E_FAIL;
            m_position = node;
            return S_OK;
        }
        default:
            return E_INVALIDARG;
        }
    });
}

bool COPCBrowseServerAddressSpace::Passes(const AddrNodePtr &child, const Filter &filter) const
{
    bool kind = filter.type == OPC_BRANCH ? child->IsBranch()
                                          : (filter.type == OPC_LEAF || filter.type == OPC_FLAT) && !child->IsBranch();
    if (!kind || !MatchPattern(child->DisplayName(), filter.pattern))
        return false;
    bool type = filter.dataType == VT_EMPTY || (child->IsBranch() && child->DataType() == VT_EMPTY) ||
                SUCCEEDED(IsConvertible(child->DataType(), filter.dataType));
    return type && (filter.access == 0 || (filter.access & child->AccessRights()) != 0);
}

void COPCBrowseServerAddressSpace::Collect(const AddrNodePtr &node, const Filter &filter,
                                           std::vector<std::wstring> &names)
{
    if (!node->IsBranch() || FAILED(m_space->Refresh(node)))
        return;
    std::vector<AddrNodePtr> children = *node->Children();
    for (const AddrNodePtr &child : children) {
        if (!Passes(child, filter))
            continue;
        if (filter.type != OPC_FLAT) {
            names.push_back(child->DisplayName());
        } else {
            std::wstring id;
            if (child->ItemId(id))
                names.push_back(id);
        }
    }
    if (filter.type == OPC_FLAT)
        for (const AddrNodePtr &child : children)
            Collect(child, filter, names);
}

STDMETHODIMP COPCBrowseServerAddressSpace::BrowseOPCItemIDs(OPCBROWSETYPE dwBrowseFilterType, LPCWSTR szFilterCriteria,
                                                            VARTYPE vtDataTypeFilter, DWORD dwAccessRightsFilter,
                                                            LPENUMSTRING *ppIEnumString)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        if (!IsWritableOut(ppIEnumString))
            return E_INVALIDARG;
        *ppIEnumString = nullptr;
        if ((static_cast<DWORD>(dwBrowseFilterType) & ~3u) || (dwAccessRightsFilter & ~3u))
            return E_INVALIDARG;
        Filter filter{dwBrowseFilterType, szFilterCriteria && *szFilterCriteria ? szFilterCriteria : L"*",
                      vtDataTypeFilter, dwAccessRightsFilter};
        std::vector<std::wstring> names;
        {
            CSingleLock lock(&m_space->Lock());
            if (dwBrowseFilterType != 0)
                Collect(m_position, filter, names);
        }
        std::sort(names.begin(), names.end()); // by UTF-16 code units
        std::vector<LPOLESTR> items;
        items.reserve(names.size());
        for (const auto &name : names)
            items.push_back(TaskStrDup(name.c_str()));
        size_t count = items.size();
        HRESULT hr =
            CEnumString::Create(std::move(items), true, IID_IEnumString, reinterpret_cast<void **>(ppIEnumString));
        if (FAILED(hr))
            return hr;
        return count == 0 ? S_FALSE : S_OK;
    });
}

STDMETHODIMP COPCBrowseServerAddressSpace::GetItemID(LPWSTR szItemDataID, LPWSTR *szItemID)
{
    return ComBoundary([&]() -> HRESULT {
        CCallPass pass; // each node is read from the network once per call
        if (!IsWritableOut(szItemID) || !szItemDataID)
            return E_INVALIDARG;
        *szItemID = nullptr;
        CSingleLock lock(&m_space->Lock());
        AddrNodePtr node = m_position;
        if (*szItemDataID) {
            node = m_space->FindChild(m_position, szItemDataID);
            if (!node)
                node = m_space->FindByItemId(szItemDataID);
        }
        std::wstring id;
        if (!node || !node->ItemId(id))
            return OPC_E_UNKNOWNITEMID;
        *szItemID = TaskStrDup(id.c_str());
        return *szItemID ? S_OK : E_OUTOFMEMORY;
    });
}

STDMETHODIMP COPCBrowseServerAddressSpace::BrowseAccessPaths(LPCWSTR, LPENUMSTRING *ppIEnumAccessPaths)
{
    if (IsWritableOut(ppIEnumAccessPaths))
        *ppIEnumAccessPaths = nullptr;
    return E_NOTIMPL;
}
