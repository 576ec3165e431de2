#pragma once
// IOPCBrowseServerAddressSpace: one browse object per query of the server
// object, each with its own position in the shared address space.
#include "AddrSpace.h"
#include "ComObject.h"
#include "opcda.h"

#include <vector>

class COPCBrowseServerAddressSpace : public CComObjectRoot, public IOPCBrowseServerAddressSpace {
public:
    // A browse object at the root of space, handed out as riid.
    static HRESULT Create(CAddrSpace *space, REFIID riid, void **ppv);

    DECLARE_COM_UNKNOWN()

    STDMETHODIMP QueryOrganization(OPCNAMESPACETYPE *pNameSpaceType) override;
    STDMETHODIMP ChangeBrowsePosition(OPCBROWSEDIRECTION dwBrowseDirection, LPCWSTR szString) override;
    STDMETHODIMP BrowseOPCItemIDs(OPCBROWSETYPE dwBrowseFilterType, LPCWSTR szFilterCriteria, VARTYPE vtDataTypeFilter,
                                  DWORD dwAccessRightsFilter, LPENUMSTRING *ppIEnumString) override;
    STDMETHODIMP GetItemID(LPWSTR szItemDataID, LPWSTR *szItemID) override;
    STDMETHODIMP BrowseAccessPaths(LPCWSTR szItemID, LPENUMSTRING *ppIEnumAccessPaths) override;

protected:
    void *FindInterface(REFIID riid) override;

private:
    template <class T, class... Args> friend T *NewComObject(Args &&...args);
    COPCBrowseServerAddressSpace() = default;
    ~COPCBrowseServerAddressSpace() override;

    struct Filter {
        OPCBROWSETYPE type;
        std::wstring pattern;
        VARTYPE dataType;
        DWORD access;
    };
    bool Passes(const AddrNodePtr &child, const Filter &filter) const;
    void Collect(const AddrNodePtr &node, const Filter &filter, std::vector<std::wstring> &names);

    CAddrSpace *m_space = nullptr;
    AddrNodePtr m_position;
};
