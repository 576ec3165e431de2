#include "SimFixture.h"

#include <atomic>

namespace {
class BrowseReceiver : public ICadroBrowserReceiver {
public:
    STDMETHODIMP QueryInterface(REFIID, void **ppv) override
    {
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return ++refs; }
    STDMETHODIMP_(ULONG) Release() override { return --refs; }
    HRESULT STDMETHODCALLTYPE BrowseItemChanged() override
    {
        ++changes;
        return 0;
    }
    std::atomic<ULONG> refs{1};
    std::atomic<int> changes{0};
};

struct Entry {
    std::wstring name, description;
    wchar_t kind;
    bool leaf;
    uint16_t type, access;
};

std::vector<Entry> Children(CadroBrowser *browser, const wchar_t *url, HRESULT *hr = nullptr)
{
    std::vector<Entry> out;
    HRESULT opened = browser->Open(url);
    if (hr)
        *hr = opened;
    if (FAILED(opened))
        return out;
    BrowseRecord r;
    while (SUCCEEDED(browser->Next(kBrowseFieldMask, &r))) {
        EXPECT_EQ(r.mask, kBrowseFieldMask);
        // A null BSTR is the empty text: members without a description
        // come without one.
        out.push_back({r.name, r.description ? r.description : L"", static_cast<wchar_t>(r.kind), (r.flags & 1) != 0,
                       r.dataType, r.access});
        SysFreeString(r.name);
        SysFreeString(r.description);
    }
    return out;
}

const Entry *Find(const std::vector<Entry> &entries, const std::wstring &name)
{
    for (const auto &e : entries)
        if (e.name == name)
            return &e;
    return nullptr;
}
} // namespace

TEST(Browse, ListsMachinesProcessesObjectsAndMembers)
{
    BSTR error = nullptr;
    ASSERT_EQ(CadroSim_Load(kTestNetwork, &error), S_OK);
    BrowseReceiver receiver;
    CadroBrowser *browser = nullptr;
    ASSERT_TRUE(NewCadroBrowser(0, &receiver, &browser));

    for (const wchar_t *root : {L"\\", L"\\\\"}) {
        auto machines = Children(browser, root);
        ASSERT_EQ(machines.size(), 2u) << root;
        EXPECT_EQ(machines[0].name, L"\\\\" + Host());
        EXPECT_EQ(machines[0].kind, L'\\');
        EXPECT_FALSE(machines[0].leaf);
        EXPECT_EQ(machines[1].name, L"\\\\OTHER");
    }
    auto processes = Children(browser, L"\\\\.");
    ASSERT_EQ(processes.size(), 1u);
    EXPECT_EQ(processes[0].name, L"p");
    EXPECT_EQ(Children(browser, (L"\\\\" + Host()).c_str()).size(), 1u);
    auto objects = Children(browser, L"\\\\.\\p");
    ASSERT_EQ(objects.size(), 1u);
    EXPECT_EQ(objects[0].name, L"o");

    auto members = Children(browser, L"\\\\.\\p\\o");
    ASSERT_TRUE(Find(members, L"inner"));
    EXPECT_FALSE(Find(members, L"inner")->leaf);
    EXPECT_EQ(Find(members, L"inner")->kind, L'\\');
    const Entry *ro = Find(members, L"ro");
    ASSERT_TRUE(ro);
    EXPECT_EQ(ro->kind, L'.');
    EXPECT_TRUE(ro->leaf);
    EXPECT_EQ(ro->type, kCadroNumber);
    EXPECT_EQ(ro->access, 1);
    EXPECT_EQ(Find(members, L"wo")->access, 2);
    EXPECT_EQ(Find(members, L"narrow")->type, kCadroNarrowText);
    EXPECT_EQ(Find(members, L"wide")->type, kCadroWideText);
    EXPECT_EQ(Find(members, L"flag")->type, kCadroBoolean);
    ASSERT_TRUE(Find(members, L"(implicit)"));
    ASSERT_TRUE(Find(members, L"dash-With a description"));
    EXPECT_EQ(Find(members, L"dash-With a description")->description, L"With a description");
    EXPECT_EQ(Find(members, L"wo")->description, L"");
    EXPECT_EQ(Children(browser, L"\\\\.\\p\\o\\inner").size(), 1u);

    for (const wchar_t *unknown : {L"\\\\nowhere", L"\\\\.\\nope", L"\\\\.\\p\\nope", L"x", L"\\\\.\\p\\o.missing"}) {
        HRESULT hr = S_OK;
        Children(browser, unknown, &hr);
        EXPECT_LT(hr, 0) << unknown;
    }
    EXPECT_EQ(browser->Open(nullptr), E_POINTER);
    BrowseRecord r;
    EXPECT_LT(browser->Next(kBrowseFieldMask, &r), 0) << "nothing open";

    // Topology changes are announced and seen on the next listing.
    int before = receiver.changes;
    EXPECT_EQ(Command(L"add-member \\\\.\\p\\o\\fresh added type=bool access=rw value=true"), L"ok\n");
    EXPECT_EQ(receiver.changes, before + 1);
    EXPECT_TRUE(Find(Children(browser, L"\\\\.\\p\\o\\fresh"), L"added"));
    EXPECT_EQ(Command(L"add-member \\\\.\\p\\o\\fresh added").rfind(L"error:", 0), 0u) << "exists already";
    EXPECT_EQ(Command(L"remove-member \\\\.\\p\\o\\fresh.added"), L"ok\n");
    EXPECT_EQ(receiver.changes, before + 2);
    EXPECT_FALSE(Find(Children(browser, L"\\\\.\\p\\o\\fresh"), L"added"));

    browser->Release();
    EXPECT_EQ(receiver.refs, 1u);
}

TEST(Libraries, HostNameTextObjectsAndMemory)
{
    BSTR host = nullptr;
    EXPECT_EQ(GetHostMachineName(&host), S_OK);
    ASSERT_TRUE(host);
    wchar_t computer[MAX_COMPUTERNAME_LENGTH + 1];
    DWORD size = MAX_COMPUTERNAME_LENGTH + 1;
    GetComputerNameW(computer, &size);
    EXPECT_STREQ(host, computer);
    SysFreeString(host);
    EXPECT_EQ(GetHostMachineName(nullptr), E_POINTER);

    IUnknown *text = NewUnicodeGuts(L"gr\u00fc\u00dfe");
    ASSERT_TRUE(text);
    ICadroWideText *wide = nullptr;
    ASSERT_EQ(text->QueryInterface(__uuidof(ICadroWideText), reinterpret_cast<void **>(&wide)), S_OK);
    EXPECT_STREQ(wide->Chars(), L"gr\u00fc\u00dfe");
    ICadroNarrowText *narrow = nullptr;
    EXPECT_EQ(text->QueryInterface(__uuidof(ICadroNarrowText), reinterpret_cast<void **>(&narrow)), E_NOINTERFACE);
    EXPECT_EQ(wide->Release(), 1u);
    EXPECT_EQ(text->AddRef(), 2u);
    EXPECT_EQ(text->Release(), 1u);
    EXPECT_EQ(text->Release(), 0u);
    EXPECT_EQ(NewUnicodeGuts(nullptr), nullptr);

    void *block = cdd_malloc(64);
    ASSERT_TRUE(block);
    cdd_free(block);
    void *buffer = tw_hmx_mem_malloc(16);
    buffer = tw_hmx_mem_realloc(buffer, 4096);
    ASSERT_TRUE(buffer);
    EXPECT_EQ(tw_hmx_mem_realloc(buffer, 0), nullptr);
    tw_hmx_mem_free(nullptr);
}
