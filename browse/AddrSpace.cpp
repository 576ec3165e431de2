#include "AddrSpace.h"

#include "CodePage.h"
#include "OpcErrors.h"
#include "Trace.h"
#include "ValueConversion.h"
#include "tw/hmx/exception/Exception.h"
#include "tw/hmx/osdep/WideToAnsi.h"

#include <cstring>
#include <cwctype>
#include <map>
#include <new>
#include <vector>

namespace {
const char kKeyPath[] = "Software";
const char *const kSubKeys[] = {"Tarnwell", "OPC Cadro Interface", "1.2"};
const char kRootsValue[] = "Cadro Root URLs";

// Ordinal comparison without regard to case; ASCII folds without the
// locale machinery that _wcsicmp goes through for every character.
wchar_t Fold(wchar_t c)
{
    if (c < 0x80)
        return c >= L'a' && c <= L'z' ? static_cast<wchar_t>(c - 32) : c;
    return static_cast<wchar_t>(towupper(c));
}

struct NoCaseStringLess {
    bool operator()(const std::wstring &a, const std::wstring &b) const
    {
        size_t n = a.size() < b.size() ? a.size() : b.size();
        for (size_t i = 0; i < n; ++i) {
            if (a[i] == b[i])
                continue;
            wchar_t x = Fold(a[i]), y = Fold(b[i]);
            if (x != y)
                return x < y;
        }
        return a.size() < b.size();
    }
};

// The host name in 8-bit text. Through ICU's default converter when ICU is
// there; without ICU the system code page does it (with "?" for what it
// lacks), so that the server still builds its address space.
std::string HostNameAnsi()
{
    BSTR host = nullptr;
    GetHostMachineName(&host);
    std::wstring name = host ? host : L"";
    SysFreeString(host);
    try {
        return tw::hmx::osdep::WideToAnsi(name.c_str(), "").get();
    } catch (const tw::hmx::exception::Exception &) {
        return ToCodePage(name, "?");
    }
}

// Opens Software\Tarnwell\OPC Cadro Interface\1.2 of HKEY_LOCAL_MACHINE,
// creating what is missing; created tells whether "1.2" is new.
HKEY OpenRootsKey(bool &created)
{
    created = false;
    HKEY key = nullptr;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, kKeyPath, 0, KEY_ALL_ACCESS, &key) != ERROR_SUCCESS)
        return nullptr;
    for (const char *sub : kSubKeys) {
        HKEY next = nullptr;
        DWORD disposition = 0;
        LONG rc = RegCreateKeyExA(key, sub, 0, const_cast<char *>(""), REG_OPTION_NON_VOLATILE, KEY_ALL_ACCESS, nullptr,
                                  &next, &disposition);
        RegCloseKey(key);
        if (rc != ERROR_SUCCESS)
            return nullptr;
        key = next;
        created = disposition == REG_CREATED_NEW_KEY;
    }
    return key;
}
} // namespace

bool CAddrNode::ItemId(std::wstring &out) const
{
    std::vector<const CAddrNode *> chain;
    std::vector<AddrNodePtr> keep; // ancestors stay alive while the text is built
    for (const CAddrNode *n = this; n && !n->m_isRoot;) {
        chain.push_back(n);
        AddrNodePtr parent = n->m_parent.lock();
        if (!parent)
            return false;
        keep.push_back(parent);
        n = parent.get();
    }
    out.clear();
    for (auto it = chain.rbegin(); it != chain.rend(); ++it)
        if (!(*it)->m_idPart.empty())
            out += (*it)->m_separator + (*it)->m_idPart;
    return true;
}

CAddrSpace *CAddrSpace::Create()
{
    return new (std::nothrow) CAddrSpace();
}

CAddrSpace::CAddrSpace() : m_root(std::make_shared<CAddrNode>())
{
    m_root->m_isRoot = true;
    m_root->m_displayName = L"<<< ROOT >>>";
    m_root->m_children = std::make_unique<std::vector<AddrNodePtr>>();
}

void CAddrSpace::SetBrowserSource(BrowserSource source)
{
    CSingleLock lock(&m_lock);
    m_browserSource = std::move(source);
}

void CAddrSpace::AddRoot(const std::wstring &name, const std::wstring &url)
{
    auto node = std::make_shared<CAddrNode>();
    node->m_parent = m_root;
    node->m_displayName = name;
    node->m_idPart = url;
    node->m_accessRights = 3;
    node->m_children = std::make_unique<std::vector<AddrNodePtr>>();
    m_root->m_children->push_back(node);
}

void CAddrSpace::AddRoots(const std::string &text)
{
    // As strtok splits: delimiters at the start of a token are skipped.
    std::vector<char> buffer(text.begin(), text.end());
    buffer.push_back('\0');
    char *context = nullptr;
    for (char *name = strtok_r(buffer.data(), "=", &context); name; name = strtok_r(nullptr, "=", &context)) {
        char *url = strtok_r(nullptr, ",", &context);
        AddRoot(FromCodePage(name), url ? FromCodePage(url) : std::wstring());
        if (!url)
            break;
    }
}

HRESULT CAddrSpace::Build()
{
    CSingleLock lock(&m_lock);
    bool created = false;
    HKEY key = OpenRootsKey(created);
    std::string value;
    if (key) {
        if (created) {
            std::string roots = HostNameAnsi() + "=\\\\" + "." + ",Network=\\";
            RegSetValueExA(key, kRootsValue, 0, REG_SZ, reinterpret_cast<const BYTE *>(roots.c_str()),
                           static_cast<DWORD>(roots.size() + 1));
        }
        DWORD type = 0, size = 0;
        if (RegQueryValueExA(key, kRootsValue, nullptr, &type, nullptr, &size) == ERROR_SUCCESS && type == REG_SZ) {
            std::vector<char> buffer(size + 1, '\0');
            if (RegQueryValueExA(key, kRootsValue, nullptr, nullptr, reinterpret_cast<BYTE *>(buffer.data()), &size) ==
                ERROR_SUCCESS)
                value = buffer.data();
            else
                type = REG_NONE;
        }
        if (type == REG_SZ)
            AddRoots(value);
        RegCloseKey(key);
        if (type == REG_SZ)
            return S_OK;
    }
    AddRoot(L"Network", L"\\\\");
    return S_OK;
}

std::wstring CAddrSpace::IdPartOf(const BrowseRecord &r)
{
    std::wstring name = !(r.mask & kBrowseName) ? L"???" : r.name ? r.name : L"";
    if (name.size() >= 2 && name[0] == L'\\' && name[1] == L'\\')
        name.erase(0, 2);
    if ((r.mask & kBrowseKind) && r.kind == L'.') {
        if (name == L"(implicit)")
            return L"";
        return name.substr(0, name.find(L'-'));
    }
    return name;
}

AddrNodePtr CAddrSpace::MakeNode(const BrowseRecord &r)
{
    auto node = std::make_shared<CAddrNode>();
    wchar_t kind = (r.mask & kBrowseKind) ? static_cast<wchar_t>(r.kind) : 0;
    std::wstring name = !(r.mask & kBrowseName) ? L"???" : r.name ? r.name : L"";
    if (name.size() >= 2 && name[0] == L'\\' && name[1] == L'\\')
        name.erase(0, 2);
    bool leaf = (r.mask & kBrowseFlags) && (r.flags & 1);
    node->m_dataType = NetworkTypeToVarType((r.mask & kBrowseDataType) ? r.dataType : 0);
    uint16_t access = (r.mask & kBrowseAccess) ? r.access : 3;
    node->m_accessRights = ((access & 1) ? OPC_READABLE : 0) | ((access & 2) ? OPC_WRITEABLE : 0);
    node->m_separator = kind ? std::wstring(1, kind) : std::wstring();
    node->m_displayName = name;
    node->m_idPart = name;
    if (kind == L'.') {
        size_t dash = name.find(L'-');
        if (name == L"(implicit)") {
            node->m_separator.clear();
            node->m_idPart.clear();
        } else if (dash != std::wstring::npos) {
            node->m_idPart = name.substr(0, dash);
        }
    }
    if (!leaf)
        node->m_children = std::make_unique<std::vector<AddrNodePtr>>();
    return node;
}

HRESULT CAddrSpace::Refresh(const AddrNodePtr &node)
{
    CSingleLock lock(&m_lock);
    if (!node->IsBranch() || node->IsRoot())
        return S_OK;
    std::wstring url;
    Browser browser;
    if (node->IsDetached() || !node->ItemId(url) || !m_browserSource || !m_browserSource(browser))
        return OPC_E_UNKNOWNITEMID;
    if (FAILED(browser.open(url.c_str())))
        return OPC_E_UNKNOWNITEMID;

    // Children by identifier part without regard to case: a reported name
    // that the tree has keeps its node (and subtree); only new names get new
    // nodes; the first of names equal but for case wins.
    std::map<std::wstring, AddrNodePtr, NoCaseStringLess> old;
    for (const AddrNodePtr &child : *node->m_children)
        old.emplace(child->m_idPart, child);
    std::map<std::wstring, AddrNodePtr, NoCaseStringLess> fresh;
    BrowseRecord record = {};
    while (SUCCEEDED(browser.next(&record))) {
        std::wstring part = IdPartOf(record);
        if (!fresh.count(part)) {
            auto kept = old.find(part);
            fresh.emplace(part, kept != old.end() ? kept->second : MakeNode(record));
        }
        SysFreeString(record.name);
        SysFreeString(record.description);
        record = {};
    }
    node->m_children->clear();
    for (auto &entry : fresh) {
        entry.second->m_parent = node;
        node->m_children->push_back(entry.second);
    }
    for (auto &entry : old) {
        auto now = fresh.find(entry.first);
        if (now == fresh.end() || now->second != entry.second)
            entry.second->m_detached = true;
    }
    return S_OK;
}

AddrNodePtr CAddrSpace::FindFrom(const AddrNodePtr &node, const std::wstring &text)
{
    std::wstring rest = text;
    if (!node->IsRoot() && !node->m_idPart.empty()) {
        const std::wstring head = node->m_separator + node->m_idPart;
        if (rest.compare(0, head.size(), head) != 0)
            return nullptr;
        rest.erase(0, head.size());
        if (rest.empty())
            return node;
        if (!node->IsBranch() || FAILED(Refresh(node)))
            return nullptr;
    } else if (!node->IsBranch()) {
        return rest.empty() ? node : nullptr; // an implicit member: only its object's own text
    }
    std::vector<AddrNodePtr> children = *node->m_children; // a refresh below may change the list
    for (const AddrNodePtr &child : children)
        if (AddrNodePtr found = FindFrom(child, rest))
            return found;
    return nullptr;
}

AddrNodePtr CAddrSpace::FindByItemId(const std::wstring &itemId)
{
    CSingleLock lock(&m_lock);
    return FindFrom(m_root, itemId);
}

AddrNodePtr CAddrSpace::FindChild(const AddrNodePtr &node, const std::wstring &name)
{
    CSingleLock lock(&m_lock);
    if (!node->IsBranch())
        return nullptr;
    for (const AddrNodePtr &child : *node->m_children) {
        const std::wstring &shown = child->m_displayName.empty() ? child->m_idPart : child->m_displayName;
        if (shown == name)
            return child;
    }
    return nullptr;
}
