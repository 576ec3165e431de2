#pragma once
// One node of the address space: the root, a configured root child
// (a machine or the whole network), or a process, object or data member the
// network reported.
#include <oaidl.h>

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

class CAddrNode;
using AddrNodePtr = std::shared_ptr<CAddrNode>;

class CAddrNode {
public:
    virtual ~CAddrNode() = default;

    bool IsBranch() const { return m_branch != nullptr; }
    bool IsRoot() const { return m_isRoot; }
    // Dropped from the tree by a refresh while something still held it.
    bool IsDetached() const { return m_detached; }
    // The identifier built from the parents' separators and parts; empty for
    // the root. False when an ancestor has gone.
    bool ItemId(std::wstring &out) const;
    const std::wstring &DisplayName() const { return m_displayName; }
    // A member's part is the display name up to its first "-" (or nothing,
    // for "(implicit)"); only root children keep a text of their own.
    std::wstring_view IdPart() const
    {
        return m_branch && m_branch->ownIdPart ? std::wstring_view(*m_branch->ownIdPart)
                                               : std::wstring_view(m_displayName).substr(0, m_idPartLength);
    }
    std::wstring_view Separator() const { return std::wstring_view(&m_separator, m_separator ? 1 : 0); }
    VARTYPE DataType() const { return m_dataType; }
    DWORD AccessRights() const { return m_accessRights; }
    AddrNodePtr Parent() const { return m_parent.lock(); }
    std::vector<AddrNodePtr> *Children() { return m_branch ? &m_branch->children : nullptr; }

private:
    friend class CAddrSpace;

    // What only branches carry: the children in ascending order of part
    // without regard to case, and what bounds the probes of a lookup step:
    // the distinct lengths of the branch children's parts and of the leaf
    // children's (a leaf's part must end the identifier, so one probe at
    // the length of the rest finds it), the separators that children have,
    // and whether any part has none.
    //
    // And an index of the children by their parts, so that a lookup step
    // and a refresh find a child in constant time rather than by a search
    // among many thousands of siblings: open addressing over the hashes of
    // the parts folded to one case, rebuilt whenever the children change.
    struct Slot {
        uint32_t hash;
        uint32_t position; // in children, plus one; 0 for an empty slot
    };
    // What only branches carry sits here, so that a leaf, of which a plant
    // has tens of thousands, is as small as it can be.
    struct Branch {
        std::vector<AddrNodePtr> children;
        std::vector<uint32_t> branchLengths;
        std::vector<uint32_t> leafLengths;
        std::wstring separators;
        bool bareParts = false;                  // a child with a part and no separator
        std::vector<Slot> index;                 // empty: search the list instead
        uint64_t refreshPass = 0;                // the call pass that last read the children
        HRESULT refreshResult = S_OK;            // and what that read gave
        std::unique_ptr<std::wstring> ownIdPart; // root children: the configured URL
    };

    std::weak_ptr<CAddrNode> m_parent;
    std::unique_ptr<Branch> m_branch; // null for a leaf
    std::wstring m_displayName;
    uint64_t m_seenMark = 0; // a refresh's mark on the children it was told about
    uint32_t m_idPartLength = 0;
    VARTYPE m_dataType = VT_EMPTY;
    BYTE m_accessRights = 3; // OPC_READABLE | OPC_WRITEABLE
    wchar_t m_separator = 0; // the network's kind character; 0 for none
    bool m_isRoot = false;
    bool m_detached = false;
};
