#include "AddrSpace.h"

#include "CallPass.h"
#include "CodePage.h"
#include "OpcErrors.h"
#include "Trace.h"
#include "ValueConversion.h"
#include "tw/hmx/exception/Exception.h"
#include "tw/hmx/osdep/WideToAnsi.h"

#include <algorithm>
#include <cstring>
#include <cwctype>
#include <iterator>
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

int CompareNoCase(std::wstring_view a, std::wstring_view b)
{
    size_t n = a.size() < b.size() ? a.size() : b.size();
    for (size_t i = 0; i < n; ++i) {
        if (a[i] == b[i])
            continue;
        wchar_t x = Fold(a[i]), y = Fold(b[i]);
        if (x != y)
            return x < y ? -1 : 1;
    }
    return a.size() < b.size() ? -1 : a.size() > b.size() ? 1 : 0;
}

bool PartLess(const AddrNodePtr &a, const AddrNodePtr &b)
{
    return CompareNoCase(a->IdPart(), b->IdPart()) < 0;
}

uint32_t PartHash(std::wstring_view part)
{
    uint32_t h = 2166136261u; // FNV-1a over the folded characters
    for (wchar_t c : part)
        h = (h ^ static_cast<uint32_t>(Fold(c))) * 16777619u;
    return h;
}

} // namespace

const AddrNodePtr *CAddrSpace::FindPart(const CAddrNode &node, std::wstring_view part)
{
    const CAddrNode::Branch &branch = *node.m_branch;
    const std::vector<AddrNodePtr> &children = branch.children;
    if (!branch.index.empty()) {
        uint32_t hash = PartHash(part);
        size_t mask = branch.index.size() - 1;
        for (size_t i = hash & mask;; i = (i + 1) & mask) {
            const CAddrNode::Slot &slot = branch.index[i];
            if (slot.position == 0)
                return nullptr;
            if (slot.hash == hash && CompareNoCase(children[slot.position - 1]->IdPart(), part) == 0)
                return &children[slot.position - 1];
        }
    }
    auto it = std::lower_bound(children.begin(), children.end(), part, [](const AddrNodePtr &c, std::wstring_view p) {
        return CompareNoCase(c->IdPart(), p) < 0;
    });
    return it != children.end() && CompareNoCase((*it)->IdPart(), part) == 0 ? &*it : nullptr;
}

void CAddrSpace::IndexChildren(CAddrNode &node)
{
    CAddrNode::Branch &branch = *node.m_branch;
    branch.index.clear();
    size_t count = branch.children.size();
    if (count < 8 || count >= UINT32_MAX / 4)
        return;
    size_t size = 16;
    while (size < count * 2)
        size *= 2;
    branch.index.assign(size, CAddrNode::Slot{0, 0});
    for (size_t position = 0; position < count; ++position) {
        uint32_t hash = PartHash(branch.children[position]->IdPart());
        size_t i = hash & (size - 1);
        while (branch.index[i].position != 0)
            i = (i + 1) & (size - 1);
        branch.index[i] = {hash, static_cast<uint32_t>(position + 1)};
    }
}

namespace {

// A record's name as the tree shows it: "???" without one, and without the
// two leading backslashes of a machine.
std::wstring_view RecordName(const BrowseRecord &r)
{
    std::wstring_view name = !(r.mask & kBrowseName) ? L"???" : r.name ? r.name : L"";
    if (name.size() >= 2 && name[0] == L'\\' && name[1] == L'\\')
        name.remove_prefix(2);
    return name;
}

VARTYPE DataTypeOf(const BrowseRecord &r)
{
    return NetworkTypeToVarType((r.mask & kBrowseDataType) ? r.dataType : 0);
}

DWORD RightsOf(const BrowseRecord &r)
{
    uint16_t access = (r.mask & kBrowseAccess) ? r.access : 3;
    return ((access & 1) ? OPC_READABLE : 0) | ((access & 2) ? OPC_WRITEABLE : 0);
}

bool IsMemberRecord(const BrowseRecord &r)
{
    return (r.mask & kBrowseKind) && r.kind == L'.';
}

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
    // Twice up the parents: once for the length, once to fill from the end,
    // so that the text is built in place.
    size_t length = 0;
    for (const CAddrNode *n = this; !n->m_isRoot;) {
        length += n->IdPart().empty() ? 0 : n->Separator().size() + n->IdPart().size();
        AddrNodePtr parent = n->m_parent.lock();
        if (!parent)
            return false;
        n = parent.get(); // held by its own parent, under the tree's lock
    }
    out.assign(length, L'\0');
    size_t end = length;
    for (const CAddrNode *n = this; !n->m_isRoot; n = n->m_parent.lock().get()) {
        std::wstring_view part = n->IdPart();
        if (part.empty())
            continue;
        end -= part.size();
        part.copy(&out[end], part.size());
        end -= n->Separator().size();
        n->Separator().copy(&out[end], n->Separator().size());
    }
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
    m_root->m_branch = std::make_unique<CAddrNode::Branch>();
}

void CAddrSpace::SetBrowserSource(BrowserSource source, BrowserSource parallel)
{
    CSingleLock lock(&m_lock);
    m_browserSource = std::move(source);
    m_parallelSource = std::move(parallel);
}

void CAddrSpace::AddRoot(const std::wstring &name, const std::wstring &url)
{
    auto node = std::make_shared<CAddrNode>();
    node->m_parent = m_root;
    node->m_displayName = name;
    node->m_accessRights = 3;
    node->m_branch = std::make_unique<CAddrNode::Branch>();
    node->m_branch->ownIdPart = std::make_unique<std::wstring>(url);
    m_root->m_branch->children.push_back(node);
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

std::wstring_view CAddrSpace::IdPartOf(const BrowseRecord &r)
{
    std::wstring_view name = RecordName(r);
    if (IsMemberRecord(r)) {
        if (name == L"(implicit)")
            return {};
        return name.substr(0, name.find(L'-'));
    }
    return name;
}

AddrNodePtr CAddrSpace::MakeNode(const BrowseRecord &r)
{
    auto node = std::make_shared<CAddrNode>();
    std::wstring_view name = RecordName(r);
    bool leaf = (r.mask & kBrowseFlags) && (r.flags & 1);
    node->m_dataType = DataTypeOf(r);
    node->m_accessRights = static_cast<BYTE>(RightsOf(r));
    node->m_separator = (r.mask & kBrowseKind) ? static_cast<wchar_t>(r.kind) : 0;
    node->m_displayName.assign(name);
    node->m_idPartLength = static_cast<uint32_t>(IdPartOf(r).size()); // always a prefix of the name
    if (IsMemberRecord(r) && name == L"(implicit)")
        node->m_separator = 0;
    if (!leaf)
        node->m_branch = std::make_unique<CAddrNode::Branch>();
    return node;
}

HRESULT CAddrSpace::Refresh(const AddrNodePtr &node)
{
    CSingleLock lock(&m_lock);
    if (!node->IsBranch() || node->IsRoot())
        return S_OK;
    uint64_t pass = CCallPass::Current();
    CAddrNode::Branch &branch = *node->m_branch;
    if (pass != 0 && branch.refreshPass == pass)
        return branch.refreshResult;
    HRESULT hr = ReadChildren(node);
    branch.refreshPass = pass;
    branch.refreshResult = hr;
    return hr;
}

HRESULT CAddrSpace::ReadChildren(const AddrNodePtr &node)
{
    Browser browser;
    if (node->IsDetached() || !node->ItemId(m_url) || !m_browserSource || !m_browserSource(browser))
        return OPC_E_UNKNOWNITEMID;
    if (FAILED(browser.open(m_url.c_str())))
        return OPC_E_UNKNOWNITEMID;
    MergeRecords(node, [&](BrowseRecord *record) { return browser.next(record); });
    return S_OK;
}

void CAddrSpace::MergeRecords(const AddrNodePtr &node, const std::function<HRESULT(BrowseRecord *record)> &next)
{
    // Each record is looked up among the present children by its part
    // without regard to case and marks the child it finds: a name the tree
    // has keeps its node (and subtree); only names it lacks make new nodes,
    // and the first of names equal but for case wins. Nothing is allocated
    // unless the network reported something the tree lacks.
    std::vector<AddrNodePtr> &children = node->m_branch->children;
    uint64_t mark = ++m_lastMark;
    size_t seen = 0;
    std::vector<AddrNodePtr> fresh;
    BrowseRecord record = {};
    while (SUCCEEDED(next(&record))) {
        if (const AddrNodePtr *known = FindPart(*node, IdPartOf(record))) {
            if ((*known)->m_seenMark != mark) {
                // A kept node keeps its texts and subtree, and takes the
                // member's present type and rights (a member made read-only
                // is seen by the next call).
                (*known)->m_seenMark = mark;
                (*known)->m_dataType = DataTypeOf(record);
                (*known)->m_accessRights = static_cast<BYTE>(RightsOf(record));
                ++seen;
            }
        } else {
            fresh.push_back(MakeNode(record));
        }
        SysFreeString(record.name);
        SysFreeString(record.description);
        record = {};
    }
    if (!fresh.empty() || seen != children.size())
        Merge(node, fresh);
}

void CAddrSpace::Merge(const AddrNodePtr &node, std::vector<AddrNodePtr> &fresh)
{
    // New names in order, the first of equal ones kept.
    std::stable_sort(fresh.begin(), fresh.end(), PartLess);
    fresh.erase(std::unique(fresh.begin(), fresh.end(),
                            [](const AddrNodePtr &a, const AddrNodePtr &b) { return !PartLess(a, b); }),
                fresh.end());
    std::vector<AddrNodePtr> &children = node->m_branch->children;
    uint64_t mark = m_lastMark;
    std::vector<AddrNodePtr> kept;
    kept.reserve(children.size());
    for (AddrNodePtr &child : children) {
        if (child->m_seenMark == mark)
            kept.push_back(std::move(child));
        else
            child->m_detached = true;
    }
    children.clear();
    std::merge(std::make_move_iterator(kept.begin()), std::make_move_iterator(kept.end()),
               std::make_move_iterator(fresh.begin()), std::make_move_iterator(fresh.end()),
               std::back_inserter(children), PartLess);
    CAddrNode::Branch &branch = *node->m_branch;
    branch.branchLengths.clear();
    branch.leafLengths.clear();
    branch.separators.clear();
    branch.bareParts = false;
    for (const AddrNodePtr &child : children) {
        child->m_parent = node;
        uint32_t length = static_cast<uint32_t>(child->IdPart().size());
        std::vector<uint32_t> &lengths = child->IsBranch() ? branch.branchLengths : branch.leafLengths;
        if (std::find(lengths.begin(), lengths.end(), length) == lengths.end())
            lengths.push_back(length);
        if (length != 0 && !child->m_separator)
            branch.bareParts = true;
        if (child->m_separator && branch.separators.find(child->m_separator) == std::wstring::npos)
            branch.separators.push_back(child->m_separator);
    }
    IndexChildren(*node);
}

// Pointers into a node's list of children: no lookup below a step changes
// the list of the node it steps from (a node is read once per call, and only
// its own list changes when it is). Held inline, so that a lookup allocates
// nothing; only a node with unusually many lengths of part spills over.
struct CAddrSpace::Steps {
    static constexpr size_t kInline = 16;
    const AddrNodePtr *inlined[kInline];
    std::vector<const AddrNodePtr *> spilled; // all of them, once there are more
    size_t size = 0;

    void Add(const AddrNodePtr *child)
    {
        if (size == kInline)
            spilled.assign(inlined, inlined + kInline);
        if (size < kInline)
            inlined[size] = child;
        else
            spilled.push_back(child);
        ++size;
    }
    const AddrNodePtr **begin() { return size <= kInline ? inlined : spilled.data(); }
    const AddrNodePtr **end() { return begin() + size; }
};

void CAddrSpace::Candidates(CAddrNode &node, std::wstring_view text, Steps &out)
{
    const std::vector<AddrNodePtr> &children = node.m_branch->children;
    if (node.IsRoot()) {
        // The registry's roots, in its order, may repeat: tried one by one.
        for (const AddrNodePtr &child : children)
            out.Add(&child);
        return;
    }
    // A child can be the next step only if the text begins with its
    // separator and part: probe the part (through the branch's index of
    // parts) with a separator before it when the text begins with one that
    // a child has, and without when a child has none; at each length that a
    // branch child's part has, and at the length of the whole rest for a
    // leaf, whose part must end the identifier (any other leaf would fail
    // the next step). A part without text (an implicit member) matches
    // whatever follows, and sorts first.
    const CAddrNode::Branch &branch = *node.m_branch;
    auto has = [](const std::vector<uint32_t> &lengths, size_t length) {
        return std::find(lengths.begin(), lengths.end(), length) != lengths.end();
    };
    if (has(branch.branchLengths, 0) || has(branch.leafLengths, 0))
        out.Add(&children.front());
    auto probe = [&](size_t separator, size_t length) {
        if (length == 0 || text.size() < separator + length)
            return;
        const AddrNodePtr *child = FindPart(node, text.substr(separator, length));
        if (child && (*child)->IdPart() == text.substr(separator, length) &&
            (*child)->Separator() == text.substr(0, separator))
            out.Add(child);
    };
    for (size_t separator = 0; separator <= 1; ++separator) {
        if (separator == 0 ? !branch.bareParts : text.empty() || branch.separators.find(text[0]) == std::wstring::npos)
            continue;
        for (uint32_t length : branch.branchLengths)
            probe(separator, length);
        if (text.size() > separator && has(branch.leafLengths, text.size() - separator))
            probe(separator, text.size() - separator);
    }
    // In list order, as the walk over every child would try them.
    std::sort(out.begin(), out.end(), std::less<const AddrNodePtr *>());
}

AddrNodePtr CAddrSpace::FindFrom(const AddrNodePtr &node, std::wstring_view text)
{
    std::wstring_view rest = text;
    if (!node->IsRoot() && !node->IdPart().empty()) {
        std::wstring_view separator = node->Separator(), part = node->IdPart();
        if (rest.substr(0, separator.size()) != separator || rest.substr(separator.size(), part.size()) != part)
            return nullptr;
        rest.remove_prefix(separator.size() + part.size());
        if (rest.empty())
            return node;
        if (!node->IsBranch() || FAILED(Refresh(node)))
            return nullptr;
    } else if (!node->IsBranch()) {
        return rest.empty() ? node : nullptr; // an implicit member: only its object's own text
    }
    Steps candidates;
    Candidates(*node, rest, candidates);
    for (const AddrNodePtr *child : candidates)
        if (AddrNodePtr found = FindFrom(*child, rest))
            return found;
    return nullptr;
}

CAddrSpace::Ahead CAddrSpace::NextRead(const AddrNodePtr &node, std::wstring_view text, uint64_t pass,
                                       AddrNodePtr &toRead)
{
    // FindFrom's walk, stopping where it would read a branch.
    std::wstring_view rest = text;
    if (!node->IsRoot() && !node->IdPart().empty()) {
        std::wstring_view separator = node->Separator(), part = node->IdPart();
        if (rest.substr(0, separator.size()) != separator || rest.substr(separator.size(), part.size()) != part)
            return Ahead::Missing;
        rest.remove_prefix(separator.size() + part.size());
        if (rest.empty())
            return Ahead::Found;
        if (!node->IsBranch())
            return Ahead::Missing;
        const CAddrNode::Branch &branch = *node->m_branch;
        if (branch.refreshPass != pass) {
            toRead = node;
            return Ahead::Read;
        }
        if (FAILED(branch.refreshResult))
            return Ahead::Missing;
    } else if (!node->IsBranch()) {
        return rest.empty() ? Ahead::Found : Ahead::Missing;
    }
    Steps candidates;
    Candidates(*node, rest, candidates);
    for (const AddrNodePtr *child : candidates) {
        Ahead ahead = NextRead(*child, rest, pass, toRead);
        if (ahead != Ahead::Missing)
            return ahead;
    }
    return Ahead::Missing;
}

AddrNodePtr CAddrSpace::FindByItemId(std::wstring_view itemId)
{
    CSingleLock lock(&m_lock);
    return FindFrom(m_root, itemId);
}

AddrNodePtr CAddrSpace::FindChild(const AddrNodePtr &node, const std::wstring &name)
{
    CSingleLock lock(&m_lock);
    if (!node->IsBranch())
        return nullptr;
    for (const AddrNodePtr &child : *node->Children()) {
        std::wstring_view shown =
            child->m_displayName.empty() ? child->IdPart() : std::wstring_view(child->m_displayName);
        if (shown == name)
            return child;
    }
    return nullptr;
}
