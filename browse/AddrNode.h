#pragma once
// One node of the address space: the root, a configured root child
// (a machine or the whole network), or a process, object or data member the
// network reported.
#include <oaidl.h>

#include <memory>
#include <string>
#include <vector>

class CAddrNode;
using AddrNodePtr = std::shared_ptr<CAddrNode>;

class CAddrNode {
public:
    virtual ~CAddrNode() = default;

    bool IsBranch() const { return m_children != nullptr; }
    bool IsRoot() const { return m_isRoot; }
    // Dropped from the tree by a refresh while something still held it.
    bool IsDetached() const { return m_detached; }
    // The identifier built from the parents' separators and parts; empty for
    // the root. False when an ancestor has gone.
    bool ItemId(std::wstring &out) const;
    const std::wstring &DisplayName() const { return m_displayName; }
    const std::wstring &IdPart() const { return m_idPart; }
    const std::wstring &Separator() const { return m_separator; }
    VARTYPE DataType() const { return m_dataType; }
    DWORD AccessRights() const { return m_accessRights; }
    AddrNodePtr Parent() const { return m_parent.lock(); }
    std::vector<AddrNodePtr> *Children() { return m_children.get(); }

private:
    friend class CAddrSpace;

    std::weak_ptr<CAddrNode> m_parent;
    std::unique_ptr<std::vector<AddrNodePtr>> m_children; // null for a leaf
    DWORD m_accessRights = 3;
    VARTYPE m_dataType = VT_EMPTY;
    std::wstring m_separator;
    std::wstring m_displayName;
    std::wstring m_idPart;
    bool m_isRoot = false;
    bool m_detached = false;
};
