#include "Network.h"

#include "Wire.h"

#include <algorithm>
#include <cwctype>

namespace cadrosim {

namespace {
bool EqualNoCase(const std::wstring &a, const std::wstring &b)
{
    return a.size() == b.size() &&
           std::equal(a.begin(), a.end(), b.begin(), [](wchar_t x, wchar_t y) { return towlower(x) == towlower(y); });
}

// Reads one name at pos: quoted ('a''b') or plain up to a separator.
bool ReadName(const std::wstring &url, size_t &pos, std::wstring &name)
{
    name.clear();
    if (pos < url.size() && url[pos] == L'\'') {
        for (++pos; pos < url.size(); ++pos) {
            if (url[pos] == L'\'') {
                if (pos + 1 < url.size() && url[pos + 1] == L'\'') {
                    name += L'\'';
                    ++pos;
                    continue;
                }
                ++pos;
                return true;
            }
            name += url[pos];
        }
        return false; // no closing quote
    }
    while (pos < url.size() && url[pos] != L'\\' && url[pos] != L'.')
        name += url[pos++];
    return !name.empty();
}

// Whether a URL can spell the name as it is: ReadName takes it whole.
bool Plain(const std::wstring &name)
{
    return !name.empty() && name[0] != L'\'' && name.find_first_of(L"\\.") == std::wstring::npos;
}

BrowseEntry Branch(const std::wstring &name)
{
    BrowseEntry e;
    e.name = name;
    return e;
}
} // namespace

bool SplitUrl(const std::wstring &url, std::wstring &machine, std::vector<std::wstring> &segments, std::wstring &member,
              bool &hasMember)
{
    segments.clear();
    member.clear();
    hasMember = false;
    if (url.size() < 3 || url[0] != L'\\' || url[1] != L'\\')
        return false;
    size_t pos = url.find(L'\\', 2);
    machine = url.substr(2, pos == std::wstring::npos ? std::wstring::npos : pos - 2);
    if (machine.empty())
        return false;
    if (pos == std::wstring::npos)
        return true;
    ++pos; // the process and the objects, separated by "\"; a member after "."
    while (true) {
        std::wstring name;
        if (!ReadName(url, pos, name))
            return false;
        segments.push_back(name);
        if (pos == url.size())
            return true;
        if (url[pos] == L'\\') {
            ++pos;
            continue;
        }
        // "." : the rest names a member of the object (nothing after a final
        // "." names the object's implicit member).
        if (segments.size() < 2)
            return false;
        ++pos;
        if (pos == url.size())
            return true;
        if (!ReadName(url, pos, member) || pos != url.size())
            return false;
        hasMember = true;
        return true;
    }
}

Network::Network(std::wstring hostName) : m_host(std::move(hostName)) {}

Machine *Network::FindMachine(const std::wstring &name)
{
    const std::wstring &wanted = name == L"." ? m_host : name;
    for (auto &m : m_machines)
        if (EqualNoCase(m->name, wanted))
            return m.get();
    return nullptr;
}

void Network::Catalogue(std::vector<uint64_t> &out) const
{
    out.clear();
    for (auto &machine : m_machines) {
        if (!machine->node.empty())
            continue; // another node's: only that node knows its members
        std::wstring lower = machine->name;
        for (wchar_t &c : lower)
            c = static_cast<wchar_t>(towlower(c));
        std::vector<std::wstring> spellings{lower};
        if (EqualNoCase(machine->name, m_host))
            spellings.push_back(L".");
        for (const std::wstring &name : spellings) {
            uint64_t machineHash = wire::UrlHash(L"\\\\" + name);
            for (auto &process : machine->processes) {
                if (!Plain(process->name))
                    continue;
                uint64_t processHash = wire::UrlHash(L"\\" + process->name, machineHash);
                for (auto &object : process->objects)
                    CatalogueObject(*object, processHash, out);
            }
        }
    }
    std::sort(out.begin(), out.end());
    out.erase(std::unique(out.begin(), out.end()), out.end());
}

void Network::CatalogueObject(const Object &object, uint64_t parentHash, std::vector<uint64_t> &out)
{
    if (!Plain(object.name))
        return;
    uint64_t objectHash = wire::UrlHash(L"\\" + object.name, parentHash);
    for (auto &member : object.members) {
        if (member->idPart.empty())
            out.push_back(objectHash); // "(implicit)": the object's URL
        else if (Plain(member->idPart))
            out.push_back(wire::UrlHash(L"." + member->idPart, objectHash));
    }
    for (auto &child : object.objects)
        CatalogueObject(*child, objectHash, out);
}

Object *Network::FindObject(Process &process, const std::vector<std::wstring> &names, size_t count)
{
    Object *current = nullptr;
    for (size_t i = 0; i < count; ++i) {
        auto &index = current ? current->objectIndex : process.objectIndex;
        auto it = index.find(names[i]);
        if (it == index.end())
            return nullptr;
        current = it->second;
    }
    return current;
}

bool Network::ParseUrl(const std::wstring &url, Path &path)
{
    std::wstring machine;
    std::vector<std::wstring> segments;
    if (!SplitUrl(url, machine, segments, path.member, path.hasMember))
        return false;
    path.machine = FindMachine(machine);
    if (!path.machine)
        return false;
    if (segments.empty())
        return true;
    auto &processes = path.machine->processes;
    auto it = std::find_if(processes.begin(), processes.end(), [&](auto &p) { return p->name == segments[0]; });
    if (it == processes.end())
        return false;
    path.process = it->get();
    path.objects.assign(std::make_move_iterator(segments.begin() + 1), std::make_move_iterator(segments.end()));
    return true;
}

Object *Network::FindMemberSlot(const std::wstring &url, MemberPtr &member)
{
    member.reset();
    Path path;
    if (!ParseUrl(url, path) || !path.process || path.objects.empty())
        return nullptr;
    Object *object = FindObject(*path.process, path.objects, path.objects.size());
    if (!object)
        return nullptr;
    // An object's own URL names its "(implicit)" member, whose part is empty.
    auto it = object->memberIndex.find(path.hasMember ? path.member : std::wstring());
    if (it == object->memberIndex.end())
        return nullptr;
    member = it->second;
    return object;
}

MemberPtr Network::FindMember(const std::wstring &url)
{
    MemberPtr member;
    FindMemberSlot(url, member);
    return member;
}

bool Network::List(const std::wstring &url, std::vector<BrowseEntry> &out)
{
    out.clear();
    if (url == L"\\" || url == L"\\\\") {
        for (auto &m : m_machines)
            out.push_back(Branch(L"\\\\" + m->name));
        return true;
    }
    Path path;
    if (!ParseUrl(url, path))
        return false;
    if (!path.process) {
        for (auto &p : path.machine->processes)
            out.push_back(Branch(p->name));
        return true;
    }
    if (path.objects.empty()) {
        for (auto &o : path.process->objects)
            out.push_back(Branch(o->name));
        return true;
    }
    Object *object = FindObject(*path.process, path.objects, path.objects.size());
    if (!object)
        return false;
    if (path.hasMember) // a member has no children
        return FindMember(url) != nullptr;
    out.reserve(object->objects.size() + object->members.size());
    for (auto &o : object->objects)
        out.push_back(Branch(o->name));
    for (auto &m : object->members) {
        BrowseEntry e;
        e.name = m->name;
        e.kind = L'.';
        e.leaf = true;
        e.dataType = static_cast<uint16_t>(m->type);
        e.access = static_cast<uint16_t>(m->access);
        e.named = NamesAMember(*object, *m);
        out.push_back(std::move(e));
    }
    return true;
}

bool Network::NamesAMember(const Object &object, const Member &member)
{
    // The URL is the object's and "." and the name up to its first "-" (the
    // object's own for "(implicit)"): a plain part is read back as the
    // member's name, so the object's index tells. Other parts (empty,
    // quoted, with a separator) are left to a lookup by URL. Every listed
    // member is in the index under its own part, so a name whose part is
    // that one needs no lookup: a listing asks this of each of its members.
    const std::wstring &name = member.name;
    if (name == L"(implicit)")
        return member.idPart.empty() || object.memberIndex.count(std::wstring()) != 0;
    std::wstring_view part(name.data(), std::min(name.find(L'-'), name.size()));
    if (part.empty() || part[0] == L'\'' || part.find_first_of(L"\\.") != std::wstring_view::npos)
        return false;
    return part == member.idPart || object.memberIndex.count(std::wstring(part)) != 0;
}

Object *Network::EnsureObject(const std::wstring &objectUrl, std::wstring &error)
{
    Path path;
    if (!ParseUrl(objectUrl, path) || !path.process || path.objects.empty() || path.hasMember) {
        error = L"no such process, or not an object URL: " + objectUrl;
        return nullptr;
    }
    Object *object = nullptr;
    auto *children = &path.process->objects;
    auto *index = &path.process->objectIndex;
    for (const auto &name : path.objects) {
        auto it = index->find(name);
        if (it == index->end()) {
            children->push_back(std::make_unique<Object>());
            children->back()->name = name;
            it = index->emplace(name, children->back().get()).first;
        }
        object = it->second;
        children = &object->objects;
        index = &object->objectIndex;
    }
    return object;
}

bool Network::AddMember(const std::wstring &objectUrl, MemberPtr member, std::wstring &error)
{
    Object *object = EnsureObject(objectUrl, error);
    if (!object)
        return false;
    std::wstring machineName;
    std::vector<std::wstring> segments;
    std::wstring ignored;
    bool hasMember = false;
    SplitUrl(objectUrl, machineName, segments, ignored, hasMember);
    member->machine = FindMachine(machineName);
    auto added = object->memberIndex.emplace(member->idPart, member);
    if (!added.second) {
        const Member &m = *added.first->second;
        error = L"the object already has a member " + (m.idPart.empty() ? m.name : m.idPart);
        return false;
    }
    object->members.push_back(std::move(member));
    return true;
}

MemberPtr Network::RemoveMember(const std::wstring &url)
{
    MemberPtr removed;
    Object *object = FindMemberSlot(url, removed);
    if (!object)
        return nullptr;
    object->memberIndex.erase(removed->idPart);
    auto &members = object->members;
    members.erase(std::find(members.begin(), members.end(), removed));
    return removed;
}

} // namespace cadrosim
