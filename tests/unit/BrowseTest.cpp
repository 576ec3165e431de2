// The address space and the browse interface: the pattern matcher, nodes
// from browse records, merges on refresh, lookups, and browsing the simulated
// default network through the server object.
#include "AddrSpace.h"
#include "CadroSim.h"
#include "CallPass.h"
#include "InProcServer.h"
#include "OpcErrors.h"
#include "PatternMatch.h"

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <utility>

namespace {
BrowseRecord Record(const wchar_t *name, wchar_t kind, bool leaf, uint16_t type = 0, uint16_t access = 3)
{
    BrowseRecord r = {};
    r.mask = kBrowseFieldMask;
    r.name = SysAllocString(name);
    r.kind = kind;
    r.flags = leaf ? 1 : 0;
    r.dataType = type;
    r.access = access;
    return r;
}

// A listing's entry as the network gives it: a number, with the rights the
// test set for its name (read and write when none).
BrowseRecord RecordOf(const std::tuple<std::wstring, wchar_t, bool> &entry,
                      const std::map<std::wstring, uint16_t> &access)
{
    auto &[name, kind, leaf] = entry;
    auto rights = access.find(name);
    return Record(name.c_str(), kind, leaf, kCadroNumber, rights == access.end() ? 3 : rights->second);
}

// A network whose listings the test sets per URL.
struct FakeNetwork {
    std::map<std::wstring, std::vector<std::tuple<std::wstring, wchar_t, bool>>> listings;
    std::map<std::wstring, uint16_t> access; // by name; rw when absent
    std::vector<std::wstring> opened;
    std::vector<std::tuple<std::wstring, wchar_t, bool>> current;
    size_t next = 0;

    CAddrSpace::BrowserSource Source()
    {
        return [this](CAddrSpace::Browser &b) {
            b.open = [this](const wchar_t *url) {
                opened.push_back(url);
                auto it = listings.find(url);
                if (it == listings.end())
                    return E_FAIL;
                current = it->second;
                next = 0;
                return S_OK;
            };
            b.next = [this](BrowseRecord *r) {
                if (next >= current.size())
                    return E_FAIL;
                *r = RecordOf(current[next++], access);
                return S_OK;
            };
            return true;
        };
    }
};

std::vector<std::wstring> Names(IEnumString *e)
{
    std::vector<std::wstring> out;
    LPOLESTR s;
    while (e && e->Next(1, &s, nullptr) == S_OK) {
        out.push_back(s);
        CoTaskMemFree(s);
    }
    return out;
}
} // namespace

TEST(PatternMatch, FollowsTheFilterRules)
{
    struct Case {
        const char *name, *pattern;
        bool match;
    } cases[] = {
        {"dx", "[!a-c]x", true},
        {"bx", "[!a-c]x", false},
        {"bx", "[a-c]x", true},
        {"dx", "[a-c]x", false},
        {"a", "[a-", false},
        {"7abc", "#*", true},
        {"ABC", "abc", false},
        {"abc", "a?c", true},
        {"ac", "a?c", false},
        {"", "*", true},
        {"", "", true},
        {"x", "", false},
        {"abc", "*c", true},
        {"abc", "a*b*c*", true},
        {"abc", "*d", false},
        {"b", "[-c]", true},
        {"x", "[ax]", true},
        {"x", "[a]", false},
        {"a]", "[a]]", true},
        {"a", "[a", false},
        {"a", "[!a", false},
        {"b", "[!a", false},
        {"a", "[a-]", true},
        {"b", "[a-]", false},
        {"q", "[!a-]", false},
        {"b", "[ab-c]", true},
        {"9", "[#]", false},
        {"c", "[a-bc]", true},
        {"cosine", "co*", true},
        {"\xe9", "[\x01-\xff]", false}, // signed: 1 to -1 is an empty range
        {"a", "[\x01-\xff]", false},
        {"\xe9", "[\x80-\xff]", true},
        {"\xe9", "[\xe0-\xef]", true},
    };
    for (const Case &c : cases)
        EXPECT_EQ(MatchPattern(std::string(c.name), std::string(c.pattern)), c.match) << c.name << " ~ " << c.pattern;
    EXPECT_TRUE(MatchPattern(std::wstring(L"caf\u00e9"), std::wstring(L"caf?")));

    // Thousands of stars and long names stay fast.
    std::string stars(10000, '*');
    std::string name(20000, 'a');
    auto start = std::chrono::steady_clock::now();
    EXPECT_TRUE(MatchPattern(name, stars));
    EXPECT_FALSE(MatchPattern(name, stars + "b"));
    EXPECT_FALSE(MatchPattern(name, std::string(5000, '*') + "a*b" + std::string(5000, '*')));
    EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20));
    EXPECT_FALSE(MatchPattern(name, "[[[[[["));
    EXPECT_FALSE(MatchPattern(name, "]]]"));
}

TEST(AddressSpace, NodesFollowKindsImplicitAndDescribedMembers)
{
    auto node = [](BrowseRecord r) {
        AddrNodePtr n = CAddrSpace::MakeNode(r);
        SysFreeString(r.name);
        return n;
    };
    AddrNodePtr machine = node(Record(L"\\\\HOST", L'\\', false));
    EXPECT_EQ(machine->DisplayName(), L"HOST");
    EXPECT_EQ(machine->Separator(), L"\\");
    EXPECT_TRUE(machine->IsBranch());
    AddrNodePtr implicit = node(Record(L"(implicit)", L'.', true));
    EXPECT_EQ(implicit->IdPart(), L"");
    EXPECT_EQ(implicit->Separator(), L"");
    EXPECT_FALSE(implicit->IsBranch());
    AddrNodePtr described = node(Record(L"cosine-Cosine wave", L'.', true, kCadroNumber, 1));
    EXPECT_EQ(described->DisplayName(), L"cosine-Cosine wave");
    EXPECT_EQ(described->IdPart(), L"cosine");
    EXPECT_EQ(described->DataType(), VT_R8);
    EXPECT_EQ(described->AccessRights(), OPC_READABLE);
    AddrNodePtr dashed = node(Record(L"a-b", L'\\', false));
    EXPECT_EQ(dashed->IdPart(), L"a-b") << "only members take the part before the dash";
    BrowseRecord bare = {};
    AddrNodePtr unnamed = CAddrSpace::MakeNode(bare);
    EXPECT_EQ(unnamed->DisplayName(), L"???");
    EXPECT_EQ(unnamed->AccessRights(), 3u);
    EXPECT_TRUE(unnamed->IsBranch());
}

TEST(AddressSpace, RefreshMergesCaseInsensitivelyAndLookupsDescend)
{
    std::unique_ptr<CAddrSpace> space(CAddrSpace::Create());
    space->AddRoots("A=\\\\x,B=\\\\y,Dangling");
    auto roots = *space->Root()->Children();
    ASSERT_EQ(roots.size(), 3u);
    std::wstring id;
    ASSERT_TRUE(roots[1]->ItemId(id));
    EXPECT_EQ(id, L"\\\\y");
    EXPECT_EQ(roots[2]->IdPart(), L"");

    FakeNetwork net;
    space->SetBrowserSource(net.Source());
    net.listings[L"\\\\x"] = {{L"proc", L'\\', false}, {L"Other", L'\\', false}};
    net.listings[L"\\\\x\\proc"] = {{L"Obj", L'\\', false}};
    net.listings[L"\\\\x\\proc\\Obj"] = {{L"m", L'.', true}, {L"(implicit)", L'.', true}, {L"M", L'.', true}};

    AddrNodePtr member = space->FindByItemId(L"\\\\x\\proc\\Obj.m");
    ASSERT_TRUE(member);
    EXPECT_EQ(net.opened, (std::vector<std::wstring>{L"\\\\x", L"\\\\x\\proc", L"\\\\x\\proc\\Obj"}));
    AddrNodePtr object = space->FindByItemId(L"\\\\x\\proc\\Obj");
    ASSERT_TRUE(object);
    EXPECT_EQ(object->Children()->size(), 2u) << "\"M\" duplicates \"m\" without regard to case";
    EXPECT_FALSE(space->FindByItemId(L"\\\\x\\proc\\Obj.mmore")) << "text past a leaf";
    EXPECT_FALSE(space->FindByItemId(L"\\\\x\\proc\\Nope"));
    EXPECT_FALSE(space->FindByItemId(L"\\\\z"));

    // The same names in another case keep the old nodes and their subtrees;
    // a vanished node is detached but stays valid for its holder.
    AddrNodePtr proc = space->FindChild(roots[0], L"proc");
    ASSERT_TRUE(proc);
    AddrNodePtr other = space->FindChild(roots[0], L"Other");
    net.listings[L"\\\\x"] = {{L"PROC", L'\\', false}, {L"new", L'\\', false}};
    ASSERT_EQ(space->Refresh(roots[0]), S_OK);
    EXPECT_EQ(space->FindChild(roots[0], L"proc"), proc);
    EXPECT_EQ(proc->Children()->size(), 1u);
    EXPECT_TRUE(other->IsDetached());
    EXPECT_EQ(space->Refresh(other), OPC_E_UNKNOWNITEMID);
    EXPECT_TRUE(space->FindChild(roots[0], L"new"));
    net.listings.erase(L"\\\\x");
    EXPECT_EQ(space->Refresh(roots[0]), OPC_E_UNKNOWNITEMID) << "a browse the network refuses";
}

namespace {
class BrowseServer : public testing::Test {
protected:
    void SetUp() override
    {
        server = CreateInProcServer();
        ASSERT_EQ(server.As(browse), S_OK);
    }
    std::vector<std::wstring> List(OPCBROWSETYPE type, const wchar_t *filter = L"", VARTYPE vt = VT_EMPTY,
                                   DWORD access = 0, HRESULT *hr = nullptr)
    {
        ComPtr<IEnumString> e;
        HRESULT result = browse->BrowseOPCItemIDs(type, filter, vt, access, e.Out());
        if (hr)
            *hr = result;
        return Names(e.Get());
    }
    ComPtr<IOPCServer> server;
    ComPtr<IOPCBrowseServerAddressSpace> browse;
};
} // namespace

TEST_F(BrowseServer, WalksTheDefaultNetworkDownAndUp)
{
    OPCNAMESPACETYPE type;
    EXPECT_EQ(browse->QueryOrganization(&type), S_OK);
    EXPECT_EQ(type, OPC_NS_HIERARCHIAL);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_UP, L""), E_FAIL) << "at the root";
    LPWSTR id = nullptr;
    EXPECT_EQ(browse->GetItemID(const_cast<wchar_t *>(L""), &id), S_OK);
    EXPECT_STREQ(id, L"");
    CoTaskMemFree(id);

    auto roots = List(OPC_BRANCH); // this machine's name and "Network", sorted
    ASSERT_EQ(roots.size(), 2u);
    std::wstring host = roots[0] == L"Network" ? roots[1] : roots[0];
    EXPECT_NE(std::find(roots.begin(), roots.end(), L"Network"), roots.end());
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, host.c_str()), S_OK);
    EXPECT_EQ(List(OPC_BRANCH), (std::vector<std::wstring>{L"proc1", L"proc2"}));
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"proc1"), S_OK);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"Pump"), S_OK);
    auto leaves = List(OPC_LEAF);
    EXPECT_EQ(leaves, (std::vector<std::wstring>{L"(implicit)", L"speed-Pump speed", L"status"}));
    EXPECT_EQ(List(OPC_LEAF, L"s*"), (std::vector<std::wstring>{L"speed-Pump speed", L"status"}));
    EXPECT_EQ(List(OPC_LEAF, L"", VT_BSTR), leaves) << "numbers and texts both give a BSTR";
    EXPECT_EQ(List(OPC_LEAF, L"", VT_BOOL), (std::vector<std::wstring>{L"(implicit)", L"speed-Pump speed"}));
    EXPECT_EQ(browse->GetItemID(const_cast<wchar_t *>(L"(implicit)"), &id), S_OK);
    EXPECT_STREQ(id, L"\\\\.\\proc1\\Pump") << "the implicit member is its object";
    CoTaskMemFree(id);
    EXPECT_EQ(browse->GetItemID(const_cast<wchar_t *>(L"speed-Pump speed"), &id), S_OK);
    EXPECT_STREQ(id, L"\\\\.\\proc1\\Pump.speed");
    CoTaskMemFree(id);
    EXPECT_EQ(browse->GetItemID(const_cast<wchar_t *>(L"nothing"), &id), OPC_E_UNKNOWNITEMID);
    EXPECT_EQ(id, nullptr);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_UP, nullptr), S_OK);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"NoSuch"), E_FAIL);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc1\\Setpoints"), S_OK);
    EXPECT_EQ(List(OPC_LEAF, L"", VT_EMPTY, OPC_WRITEABLE).size(), 5u);
    EXPECT_EQ(List(OPC_LEAF, L"", VT_EMPTY, OPC_READABLE).size(), 7u);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc1\\Nope"), E_FAIL);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L""), S_OK);
    EXPECT_EQ(List(OPC_BRANCH).size(), 2u) << "back at the root";
    EXPECT_EQ(browse->ChangeBrowsePosition(static_cast<OPCBROWSEDIRECTION>(9), L"x"), E_INVALIDARG);
}

TEST_F(BrowseServer, FlatListingsFiltersAndBadArguments)
{
    ASSERT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc1"), S_OK);
    auto flat = List(OPC_FLAT);
    EXPECT_NE(std::find(flat.begin(), flat.end(), L"\\\\.\\proc1\\Line\\Tank.level"), flat.end());
    EXPECT_NE(std::find(flat.begin(), flat.end(), L"\\\\.\\proc1\\Waveform.cosine"), flat.end());
    EXPECT_TRUE(std::is_sorted(flat.begin(), flat.end()));
    EXPECT_EQ(List(OPC_FLAT, L"cos*"), std::vector<std::wstring>{L"\\\\.\\proc1\\Waveform.cosine"});
    EXPECT_EQ(List(OPC_FLAT, L""), List(OPC_FLAT, L"*"));

    HRESULT hr;
    List(static_cast<OPCBROWSETYPE>(4), L"", VT_EMPTY, 0, &hr);
    EXPECT_EQ(hr, E_INVALIDARG);
    List(OPC_LEAF, L"", VT_EMPTY, 4, &hr);
    EXPECT_EQ(hr, E_INVALIDARG);
    EXPECT_TRUE(List(static_cast<OPCBROWSETYPE>(0), L"", VT_EMPTY, 0, &hr).empty());
    EXPECT_EQ(hr, S_FALSE);
    ComPtr<IEnumString> e;
    ASSERT_EQ(browse->BrowseOPCItemIDs(OPC_LEAF, L"zzz*", VT_EMPTY, 0, e.Out()), S_FALSE);
    LPOLESTR s;
    EXPECT_EQ(e->Next(1, &s, nullptr), E_FAIL) << "an empty result";
    EXPECT_EQ(browse->BrowseOPCItemIDs(OPC_LEAF, L"*", VT_EMPTY, 0, nullptr), E_INVALIDARG);
    List(OPC_LEAF, L"[a-", VT_EMPTY, 0, &hr);
    EXPECT_EQ(hr, S_FALSE);
    std::wstring huge(100000, L'*');
    List(OPC_FLAT, huge.c_str(), VT_EMPTY, 0, &hr);
    EXPECT_EQ(hr, S_OK);
    IEnumString *paths = nullptr;
    EXPECT_EQ(browse->BrowseAccessPaths(L"x", &paths), E_NOTIMPL);

    // Two browse objects move independently.
    ComPtr<IOPCBrowseServerAddressSpace> second;
    ASSERT_EQ(server.As(second), S_OK);
    EXPECT_NE(second.Get(), browse.Get());
    LPWSTR id = nullptr;
    second->GetItemID(const_cast<wchar_t *>(L""), &id);
    EXPECT_STREQ(id, L"");
    CoTaskMemFree(id);
}

TEST_F(BrowseServer, MembersAppearAndDisappearAndPositionsSurviveTheirNodes)
{
    auto run = [](const wchar_t *command) {
        BSTR answer = nullptr;
        CadroSim_Execute(command, &answer);
        std::wstring text = answer ? answer : L"";
        SysFreeString(answer);
        return text;
    };
    ASSERT_EQ(run(L"add-member \\\\.\\proc2\\Extra fresh type=bool"), L"ok\n");
    ASSERT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc2\\Extra"), S_OK);
    EXPECT_EQ(List(OPC_LEAF), std::vector<std::wstring>{L"fresh"});
    ASSERT_EQ(run(L"remove-member \\\\.\\proc2\\Extra.fresh"), L"ok\n");
    EXPECT_TRUE(List(OPC_LEAF).empty());

    ASSERT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_DOWN, L"(none)"), E_FAIL);
    ASSERT_EQ(run(L"add-member \\\\.\\proc2\\Gone\\Deep leaf"), L"ok\n");
    ASSERT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc2\\Gone\\Deep"), S_OK);
    ASSERT_EQ(run(L"reset"), L"ok\n"); // the objects vanish from the network
    ComPtr<IOPCBrowseServerAddressSpace> other;
    ASSERT_EQ(server.As(other), S_OK);
    ASSERT_EQ(other->ChangeBrowsePosition(OPC_BROWSE_TO, L"\\\\.\\proc2"), S_OK);
    ComPtr<IEnumString> e;
    other->BrowseOPCItemIDs(OPC_BRANCH, L"", VT_EMPTY, 0, e.Out()); // drops "Gone" from the tree
    HRESULT hr;
    EXPECT_TRUE(List(OPC_LEAF, L"", VT_EMPTY, 0, &hr).empty());
    EXPECT_EQ(hr, S_FALSE) << "a position whose node has gone lists nothing";
    LPWSTR id = nullptr;
    EXPECT_EQ(browse->GetItemID(const_cast<wchar_t *>(L""), &id), OPC_E_UNKNOWNITEMID)
        << "its parent has gone too: it has no identifier any more";
    EXPECT_EQ(id, nullptr);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_UP, L""), E_FAIL);
    EXPECT_EQ(browse->ChangeBrowsePosition(OPC_BROWSE_TO, L""), S_OK);
    EXPECT_EQ(List(OPC_BRANCH).size(), 2u);
}

TEST(AddressSpace, OneCallReadsEachNodeOnceAndTheNextCallSeesTheNetworkAgain)
{
    std::unique_ptr<CAddrSpace> space(CAddrSpace::Create());
    space->AddRoots("A=\\\\x");
    FakeNetwork net;
    space->SetBrowserSource(net.Source());
    net.listings[L"\\\\x"] = {{L"proc", L'\\', false}};
    net.listings[L"\\\\x\\proc"] = {{L"Obj", L'\\', false}};
    auto &members = net.listings[L"\\\\x\\proc\\Obj"];
    for (int i = 0; i < 500; ++i)
        members.emplace_back(L"m" + std::to_wstring(i), L'.', true);
    {
        CCallPass pass;
        for (int i = 0; i < 500; ++i)
            ASSERT_TRUE(space->FindByItemId(L"\\\\x\\proc\\Obj.m" + std::to_wstring(i))) << i;
        EXPECT_FALSE(space->FindByItemId(L"\\\\x\\proc\\Obj.m500"));
        EXPECT_EQ(net.opened.size(), 3u) << "one read per node for the whole call";
    }

    // Between calls a member is added, one removed, one made read-only.
    members.emplace_back(L"added", L'.', true);
    members.erase(members.begin());
    net.access[L"m7"] = 1;
    CCallPass next;
    EXPECT_TRUE(space->FindByItemId(L"\\\\x\\proc\\Obj.added"));
    EXPECT_FALSE(space->FindByItemId(L"\\\\x\\proc\\Obj.m0"));
    AddrNodePtr m7 = space->FindByItemId(L"\\\\x\\proc\\Obj.m7");
    ASSERT_TRUE(m7);
    EXPECT_EQ(m7->AccessRights(), static_cast<DWORD>(OPC_READABLE));
    EXPECT_EQ(net.opened.size(), 6u);
}

namespace {
// The lookup as the tree's rules state it, over every child in list order:
// what the indexed lookup must agree with.
AddrNodePtr WalkFrom(CAddrSpace &space, const AddrNodePtr &node, std::wstring text)
{
    std::wstring part(node->IdPart()), separator(node->Separator());
    if (!node->IsRoot() && !part.empty()) {
        if (text.compare(0, separator.size() + part.size(), separator + part) != 0)
            return nullptr;
        text.erase(0, separator.size() + part.size());
        if (text.empty())
            return node;
        if (!node->IsBranch() || FAILED(space.Refresh(node)))
            return nullptr;
    } else if (!node->IsBranch()) {
        return text.empty() ? node : nullptr;
    }
    std::vector<AddrNodePtr> children = *node->Children();
    for (const AddrNodePtr &child : children)
        if (AddrNodePtr found = WalkFrom(space, child, text))
            return found;
    return nullptr;
}
} // namespace

TEST(AddressSpace, IndexedLookupsFindWhatTheWalkOverEverySiblingFinds)
{
    std::unique_ptr<CAddrSpace> space(CAddrSpace::Create());
    space->AddRoots("A=\\\\x,B=\\\\x\\proc1");
    FakeNetwork net;
    space->SetBrowserSource(net.Source());
    net.listings[L"\\\\x"] = {{L"proc1", L'\\', false}, {L"proc10", L'\\', false}, {L"Proc2", L'\\', false}};
    net.listings[L"\\\\x\\proc1"] = {{L"Obj", L'\\', false}, {L"Ob", L'\\', false}};
    net.listings[L"\\\\x\\proc10"] = {{L"Obj", L'\\', false}};
    net.listings[L"\\\\x\\Proc2"] = {{L"deep", L'\\', false}};
    net.listings[L"\\\\x\\Proc2\\deep"] = {{L"er", L'\\', false}, {L"v", L'.', true}};
    net.listings[L"\\\\x\\Proc2\\deep\\er"] = {{L"v", L'.', true}};
    net.listings[L"\\\\x\\proc1\\Obj"] = {{L"(implicit)", L'.', true},
                                          {L"cosine-Cosine wave", L'.', true},
                                          {L"cos", L'.', true},
                                          {L"Sub", L'\\', false},
                                          {L"a-b", L'.', true},
                                          {L"bare", 0, true}, // parts without a separator
                                          {L"br", 0, false}};
    net.listings[L"\\\\x\\proc1\\Objbr"] = {{L"y", L'.', true}, {L"bare", 0, true}};
    net.listings[L"\\\\x\\proc1\\Ob"] = {{L"j", L'\\', false}};
    net.listings[L"\\\\x\\proc1\\Ob\\j"] = {{L"x", L'.', true}};
    net.listings[L"\\\\x\\proc1\\Obj\\Sub"] = {{L"(implicit)", L'.', true}, {L"x", L'.', true}};
    net.listings[L"\\\\x\\proc10\\Obj"] = {{L"v", L'.', true}};

    std::vector<std::wstring> ids = {
        L"\\\\x\\proc1\\Obj",        // the object, not its implicit member
        L"\\\\x\\proc1\\Obj.",       // a final mark
        L"\\\\x\\proc1\\Obj.cosine", // a member with a description
        L"\\\\x\\proc1\\Obj.cos",    // a prefix of a sibling
        L"\\\\x\\proc1\\Obj.cosin",  // no such member
        L"\\\\x\\proc1\\Obj.cosine-Cosine wave",
        L"\\\\x\\proc1\\Obj.a",        // only members split at the dash
        L"\\\\x\\proc1\\Obj.cosinex",  // past a leaf
        L"\\\\x\\proc1\\Obj.cosine.x", // past a leaf
        L"\\\\x\\proc1\\Objbare",      // a bare leaf
        L"\\\\x\\proc1\\Obj.bare",     // a bare part with a separator before it
        L"\\\\x\\proc1\\Objbr.y",      // a bare branch
        L"\\\\x\\proc1\\Objbrbare",    // and its bare leaf
        L"\\\\x\\proc1\\Objbarex",     // past a bare leaf
        L"\\\\x\\proc1\\Obj\\Sub",     // a branch whose implicit member comes first
        L"\\\\x\\proc1\\Obj\\Sub.x",
        L"\\\\x\\proc1\\Ob\\j.x", // a sibling that is a prefix: its own subtree
        L"\\\\x\\proc10\\Obj.v",  // proc1 is tried first and fails
        L"\\\\x\\PROC1\\Obj.cos", // parts match with their case
        L"\\\\x\\proc1\\obj.cos",
        L"\\\\x\\Proc2\\deep\\er.v",
        L"\\\\x\\Proc2\\deep.v",
        L"\\\\x\\proc2\\deep.v",
        L"\\\\x",
        L"\\\\y",
        L"",
        L"\\\\x\\",
        L"\\\\x\\proc1\\Obj.cos" + std::wstring(10000, L'x'),
    };
    std::wstring deep = L"\\\\x\\proc1";
    for (int i = 0; i < 2000; ++i)
        deep += L"\\Obj";
    ids.push_back(deep);

    for (const std::wstring &id : ids) {
        AddrNodePtr walked = WalkFrom(*space, space->Root(), id);
        AddrNodePtr indexed = space->FindByItemId(id);
        EXPECT_EQ(indexed, walked) << std::string(id.begin(), id.begin() + std::min<size_t>(id.size(), 60));
    }
    // The same with siblings enough that every branch has its hash index
    // (a handful are searched in their list).
    {
        FakeNetwork crowded = net;
        for (auto &listing : crowded.listings)
            for (int i = 0; i < 40; ++i)
                listing.second.push_back({L"filler" + std::to_wstring(i), L'.', true});
        std::unique_ptr<CAddrSpace> big(CAddrSpace::Create());
        big->AddRoots("A=\\\\x,B=\\\\x\\proc1");
        big->SetBrowserSource(crowded.Source());
        for (const std::wstring &id : ids) {
            AddrNodePtr walked = WalkFrom(*big, big->Root(), id);
            AddrNodePtr indexed = big->FindByItemId(id);
            EXPECT_EQ(indexed, walked) << std::string(id.begin(), id.begin() + std::min<size_t>(id.size(), 60));
            EXPECT_EQ(!indexed, !space->FindByItemId(id));
        }
    }
    // A few answers spelled out, so that both cannot be wrong alike.
    AddrNodePtr object = space->FindByItemId(L"\\\\x\\proc1\\Obj");
    ASSERT_TRUE(object);
    EXPECT_EQ(object->DisplayName(), L"Obj");
    AddrNodePtr cosine = space->FindByItemId(L"\\\\x\\proc1\\Obj.cosine");
    ASSERT_TRUE(cosine);
    EXPECT_EQ(cosine->DisplayName(), L"cosine-Cosine wave");
    AddrNodePtr implicit = space->FindByItemId(L"\\\\x\\proc1\\Obj\\Sub");
    ASSERT_TRUE(implicit);
    EXPECT_EQ(implicit->DisplayName(), L"Sub");
    EXPECT_FALSE(space->FindByItemId(L"\\\\x\\PROC1\\Obj.cos"));
    EXPECT_TRUE(space->FindByItemId(L"\\\\x\\proc10\\Obj.v"));
}

namespace {
// A network whose browsers each keep their own place, so that threads may
// read side by side. Reads of URLs that begin with waitPrefix wait (a few
// seconds at most) for another read to be under way at the same time, until
// two have been: reads that never overlap show as one at a time.
struct SharedNetwork {
    std::map<std::wstring, std::vector<std::tuple<std::wstring, wchar_t, bool>>> listings;
    std::map<std::wstring, uint16_t> access; // by name; rw when absent
    std::mutex lock;
    std::condition_variable changed;
    std::vector<std::wstring> opened;
    int reading = 0, mostReading = 0;
    std::wstring waitPrefix;

    CAddrSpace::BrowserSource Source()
    {
        return [this](CAddrSpace::Browser &b) {
            auto cursor = std::make_shared<std::pair<std::vector<std::tuple<std::wstring, wchar_t, bool>>, size_t>>();
            b.open = [this, cursor](const wchar_t *url) { return Open(url, *cursor); };
            b.next = [this, cursor](BrowseRecord *r) {
                auto &[records, next] = *cursor;
                if (next >= records.size())
                    return E_FAIL;
                *r = RecordOf(records[next++], access);
                return S_OK;
            };
            return true;
        };
    }
    HRESULT Open(const wchar_t *url, std::pair<std::vector<std::tuple<std::wstring, wchar_t, bool>>, size_t> &cursor)
    {
        std::unique_lock<std::mutex> l(lock);
        opened.push_back(url);
        mostReading = std::max(mostReading, ++reading);
        changed.notify_all();
        if (!waitPrefix.empty() && std::wstring_view(url).substr(0, waitPrefix.size()) == waitPrefix &&
            !changed.wait_for(l, std::chrono::seconds(10), [&] { return mostReading > 1; }))
            waitPrefix.clear(); // alone: the reads are one at a time, and the test fails once
        --reading;
        auto it = listings.find(url);
        if (it == listings.end())
            return E_FAIL;
        cursor = {it->second, 0};
        return S_OK;
    }
};

struct Looked {
    bool found;
    VARTYPE type;
    DWORD rights;
    bool operator==(const Looked &o) const { return found == o.found && type == o.type && rights == o.rights; }
};

// One call's lookups of ids, read ahead first or not; what they found, and
// the URLs the call read.
std::vector<Looked> LookUp(CAddrSpace &space, SharedNetwork &net, const std::vector<std::wstring> &ids, bool ahead,
                           std::multiset<std::wstring> &read)
{
    net.opened.clear();
    CCallPass pass;
    if (ahead)
        space.ReadAhead(std::vector<std::wstring_view>(ids.begin(), ids.end()));
    std::vector<Looked> found;
    for (const std::wstring &id : ids) {
        AddrNodePtr node = space.FindByItemId(id);
        Looked looked = {node != nullptr, VT_EMPTY, 0};
        if (node)
            looked.type = node->DataType(), looked.rights = node->AccessRights();
        found.push_back(looked);
    }
    read = std::multiset<std::wstring>(net.opened.begin(), net.opened.end());
    return found;
}
} // namespace

// Items of many objects in one call: the branches their lookups need are
// read several at once, level by level, and the lookups then find exactly
// what they find without reading ahead, having read the same branches, each
// once; the next call reads them again and sees the network's changes.
TEST(AddressSpace, ReadingAheadReadsTheSameBranchesOnceEachAndSeveralAtOnce)
{
    SharedNetwork net;
    net.listings[L"\\\\x"] = {{L"proc", L'\\', false}};
    std::vector<std::wstring> ids;
    for (int o = 0; o < 20; ++o) {
        std::wstring object = L"o" + std::to_wstring(o);
        net.listings[L"\\\\x\\proc"].push_back({object, L'\\', false});
        for (int m = 0; m < 5; ++m) {
            std::wstring member = L"m" + std::to_wstring(m);
            net.listings[L"\\\\x\\proc\\" + object].push_back({member, L'.', true});
            ids.push_back(L"\\\\x\\proc\\" + object + L"." + member);
        }
    }
    net.access[L"m3"] = 1;
    ids.push_back(L"\\\\x\\proc\\gone.m0");   // an object the network lacks
    ids.push_back(L"\\\\x\\proc\\o1.absent"); // a member it lacks
    ids.push_back(L"\\\\y\\elsewhere.m0");    // a machine below "Network" only
    ids.push_back(L"\\\\x\\proc\\o2.m0");     // again, apart from its siblings

    std::unique_ptr<CAddrSpace> plain(CAddrSpace::Create()), ahead(CAddrSpace::Create());
    for (CAddrSpace *space : {plain.get(), ahead.get()}) {
        space->AddRoots("A=\\\\x,Network=\\\\");
        space->SetBrowserSource(net.Source(), net.Source());
    }
    for (int call = 0; call < 2; ++call) {
        std::multiset<std::wstring> readPlain, readAhead;
        std::vector<Looked> expected = LookUp(*plain, net, ids, false, readPlain);
        net.waitPrefix = L"\\\\x\\proc\\o"; // the objects' reads
        net.mostReading = 0;
        std::vector<Looked> found = LookUp(*ahead, net, ids, true, readAhead);
        net.waitPrefix.clear();
        EXPECT_TRUE(found == expected) << "call " << call;
        EXPECT_EQ(readAhead, readPlain) << "call " << call;
        for (const std::wstring &url : readAhead)
            EXPECT_EQ(readAhead.count(url), 1u) << url;
        EXPECT_GE(net.mostReading, 2) << "the objects were read one at a time";
        EXPECT_TRUE(found[3].found);
        EXPECT_EQ(found[3].rights, call == 0 ? static_cast<DWORD>(OPC_READABLE) : OPC_READABLE | OPC_WRITEABLE);
        EXPECT_EQ(found[0].found, call == 0);
        EXPECT_FALSE(found[100].found);
        EXPECT_FALSE(found[101].found);

        // Between calls a member goes and another becomes writable.
        net.listings[L"\\\\x\\proc\\o0"].erase(net.listings[L"\\\\x\\proc\\o0"].begin());
        net.access[L"m3"] = 3;
    }
}
