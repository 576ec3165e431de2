// opc browse: the server's address space as an indented tree, or as the flat
// list of item identifiers, below a branch.
#include "Commands.h"
#include "Format.h"
#include "OpcErrors.h"
#include "TaskMem.h"

#include <memory>

namespace {
struct Filters {
    std::wstring pattern;
    VARTYPE type = VT_EMPTY;
    DWORD access = 0;
    bool Any() const { return !pattern.empty() || type != VT_EMPTY || access != 0; }
};

// A leaf's canonical type and access rights (--details).
struct Details {
    VARTYPE type = VT_EMPTY;
    DWORD access = 0;
    bool known = false;
};

std::wstring AccessName(DWORD access)
{
    switch (access & (OPC_READABLE | OPC_WRITEABLE)) {
    case OPC_READABLE:
        return L"read";
    case OPC_WRITEABLE:
        return L"write";
    case OPC_READABLE | OPC_WRITEABLE:
        return L"read/write";
    default:
        return L"none";
    }
}

// The details of every identifier, from one ValidateItems call: the server
// looks each item up once, and no item is added.
std::vector<Details> ReadDetails(IOPCServer *server, const std::vector<std::wstring> &ids)
{
    std::vector<Details> details(ids.size());
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    if (ids.empty() || FAILED(group.Create(server, 1000, false, 0)) || FAILED(group.Validate(ids, items)))
        return details;
    for (size_t i = 0; i < ids.size() && i < items.size(); ++i)
        if (SUCCEEDED(items[i].error))
            details[i] = {items[i].canonical, items[i].access, true};
    return details;
}

// The details as a text column, or as JSON fields.
std::wstring DetailsText(const Details &d)
{
    return d.known ? TypeName(d.type) + L"  " + AccessName(d.access) : L"";
}

void AddDetailFields(const Details &d, std::vector<std::pair<std::wstring, std::wstring>> &fields)
{
    if (!d.known)
        return;
    fields.push_back({L"type", JsonString(TypeName(d.type))});
    fields.push_back({L"access", JsonString(AccessName(d.access))});
}

struct Node {
    std::wstring name, itemId;
    Details details;
    bool branch = false;
    std::vector<std::unique_ptr<Node>> children;
    bool HasItems() const
    {
        for (const auto &child : children)
            if (!child->branch || child->HasItems())
                return true;
        return false;
    }
    void Leaves(std::vector<Node *> &out)
    {
        for (auto &child : children)
            if (child->branch)
                child->Leaves(out);
            else
                out.push_back(child.get());
    }
};

std::vector<std::wstring> Names(IOPCBrowseServerAddressSpace *browse, OPCBROWSETYPE kind, const Filters &filters,
                                HRESULT &hr)
{
    std::vector<std::wstring> names;
    ComPtr<IEnumString> list;
    hr = browse->BrowseOPCItemIDs(kind, filters.pattern.c_str(), filters.type, filters.access, list.Out());
    if (FAILED(hr) || !list)
        return names;
    LPOLESTR batch[64];
    ULONG fetched = 0;
    HRESULT next;
    do {
        next = list->Next(64, batch, &fetched);
        for (ULONG i = 0; i < fetched && SUCCEEDED(next); ++i) {
            TaskMem<wchar_t> owned(batch[i]);
            names.emplace_back(batch[i] ? batch[i] : L"");
        }
    } while (next == S_OK);
    return names;
}

// Reads the branch at the browse position into node, descending up to depth
// more levels; the position is the same afterwards.
HRESULT Load(IOPCBrowseServerAddressSpace *browse, const Filters &filters, int depth, Node &node)
{
    HRESULT hr;
    Filters none;
    for (const std::wstring &name : Names(browse, OPC_BRANCH, none, hr)) {
        auto child = std::make_unique<Node>();
        child->name = name;
        child->branch = true;
        if (depth > 1 && SUCCEEDED(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, name.c_str()))) {
            Load(browse, filters, depth - 1, *child);
            browse->ChangeBrowsePosition(OPC_BROWSE_UP, L"");
        }
        node.children.push_back(std::move(child));
    }
    if (FAILED(hr))
        return hr;
    for (const std::wstring &name : Names(browse, OPC_LEAF, filters, hr)) {
        auto child = std::make_unique<Node>();
        child->name = name;
        LPWSTR id = nullptr;
        if (SUCCEEDED(browse->GetItemID(const_cast<wchar_t *>(name.c_str()), &id)) && id) {
            TaskMem<wchar_t> owned(id);
            child->itemId = id;
        }
        node.children.push_back(std::move(child));
    }
    return hr;
}

void Print(const Node &node, const std::wstring &path, int level, bool prune, Output &out)
{
    for (const auto &child : node.children) {
        if (child->branch && prune && !child->HasItems())
            continue;
        std::wstring childPath = path.empty() ? child->name : path + L"/" + child->name;
        if (out.Json()) {
            std::vector<std::pair<std::wstring, std::wstring>> fields = {
                {L"kind", JsonString(child->branch ? L"branch" : L"item")},
                {L"name", JsonString(child->name)},
                {L"path", JsonString(childPath)},
                {L"depth", std::to_wstring(level)}};
            if (!child->branch) {
                fields.push_back({L"item", JsonString(child->itemId)});
                AddDetailFields(child->details, fields);
            }
            out.Line(Output::Object(fields));
        } else {
            std::wstring indent(static_cast<size_t>(level) * 2, L' ');
            std::wstring line = indent + child->name + (child->branch ? L"/" : L"");
            if (!child->branch) {
                if (line.size() < 40)
                    line.resize(40, L' ');
                line += L"  " + child->itemId;
                if (child->details.known)
                    line += L"  " + DetailsText(child->details);
            }
            out.Line(line);
        }
        if (child->branch)
            Print(*child, childPath, level + 1, prune, out);
    }
}

// Moves the browse position to the branch the user named.
HRESULT GoTo(IOPCBrowseServerAddressSpace *browse, const std::wstring &branch)
{
    if (branch.compare(0, 2, L"\\\\") == 0)
        return browse->ChangeBrowsePosition(OPC_BROWSE_TO, branch.c_str());
    HRESULT hr = browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"");
    size_t start = 0;
    while (SUCCEEDED(hr) && start < branch.size()) {
        size_t end = branch.find(L'/', start);
        if (end == std::wstring::npos)
            end = branch.size();
        if (end > start)
            hr = browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, branch.substr(start, end - start).c_str());
        start = end + 1;
    }
    return hr;
}

bool ReadFilters(const Arguments &args, Output &out, Filters &filters, int &depth)
{
    filters.pattern = args.Value(L"filter");
    if (!RequestedType(args, out, filters.type))
        return false;
    std::wstring access = args.Value(L"access");
    if (access == L"read")
        filters.access = OPC_READABLE;
    else if (access == L"write")
        filters.access = OPC_WRITEABLE;
    else if (!access.empty()) {
        out.Error(L"--access takes read or write, not \"" + access + L"\"");
        return false;
    }
    double levels = 1000;
    if (args.Has(L"depth") && !ParseNumber(args.Value(L"depth"), 1, 1000, levels)) {
        out.Error(L"--depth takes a number of levels from 1 to 1000");
        return false;
    }
    depth = static_cast<int>(levels);
    return true;
}
} // namespace

bool CheckBrowse(const Arguments &args, Output &out)
{
    Filters filters;
    int depth = 0;
    if (args.Positional().size() > 1) {
        out.Error(L"browse takes one branch at most");
        return false;
    }
    return ReadFilters(args, out, filters, depth);
}

int Browse(const Arguments &args, Output &out, Connection &server)
{
    Filters filters;
    int depth = 0;
    ReadFilters(args, out, filters, depth);
    ComPtr<IOPCBrowseServerAddressSpace> browse;
    if (FAILED(ComPtr<IOPCServer>(server.Server()).As(browse))) {
        out.Error(L"browse: the server offers no address space to browse");
        return kExitFailed;
    }
    std::wstring branch = args.Positional().empty() ? L"" : args.Positional()[0];
    HRESULT hr = GoTo(browse.Get(), branch);
    if (FAILED(hr)) {
        // The browse interface answers E_FAIL for a name or identifier it
        // cannot find; what the user needs to hear is that it is unknown.
        if (hr == E_FAIL || hr == E_INVALIDARG)
            hr = OPC_E_UNKNOWNITEMID;
        out.Error(L"browse " + branch + L": no such branch: " + server.Describe(hr));
        return kExitFailed;
    }
    OPCNAMESPACETYPE organization = OPC_NS_HIERARCHIAL;
    browse->QueryOrganization(&organization);
    bool details = args.Has(L"details");
    if (args.Has(L"flat") || organization == OPC_NS_FLAT) {
        std::vector<std::wstring> ids = Names(browse.Get(), OPC_FLAT, filters, hr);
        std::vector<Details> found = details ? ReadDetails(server.Server(), ids) : std::vector<Details>(ids.size());
        for (size_t i = 0; i < ids.size(); ++i) {
            std::vector<std::pair<std::wstring, std::wstring>> fields = {{L"item", JsonString(ids[i])}};
            AddDetailFields(found[i], fields);
            std::wstring line = ids[i];
            if (found[i].known)
                line += L"  " + DetailsText(found[i]);
            out.Line(out.Json() ? Output::Object(fields) : line);
        }
    } else {
        Node root;
        hr = Load(browse.Get(), filters, depth, root);
        if (details) {
            std::vector<Node *> leaves;
            root.Leaves(leaves);
            std::vector<std::wstring> ids;
            for (Node *leaf : leaves)
                ids.push_back(leaf->itemId);
            std::vector<Details> found = ReadDetails(server.Server(), ids);
            for (size_t i = 0; i < leaves.size(); ++i)
                leaves[i]->details = found[i];
        }
        Print(root, branch.compare(0, 2, L"\\\\") == 0 ? L"" : branch, 0, filters.Any(), out);
    }
    if (FAILED(hr)) {
        out.Error(L"browse: " + server.Describe(hr));
        return kExitFailed;
    }
    return kExitOk;
}
