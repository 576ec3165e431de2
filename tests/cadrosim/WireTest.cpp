// The frames between the libraries and the network node: what one side
// writes the other reads back, and a peer that sends garbage or half a frame
// is never read past.
#include "Wire.h"
#include "FixedPool.h"
#include "FlatMap.h"
#include "FrameQueue.h"
#include "HashSet64.h"
#include "KnownMembers.h"
#include "LinkFeed.h"
#include "Network.h"
#include "SlotTable.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <memory>
#include <mutex>
#include <random>
#include <set>
#include <thread>
#include <unordered_map>
#include <vector>

using namespace cadrosim;

TEST(Wire, FramesRoundTripAndBadOnesAreRefused)
{
    wire::Out out;
    out.Begin(wire::Kind::Subscribe);
    out.U32(7);
    out.U32(0x00400001);
    out.Text(L"\\\\HOST\\proc1\\Setpoints.temperature");
    out.End();
    // A value for two subscriptions travels once, in one frame of both ids;
    // another value, or a frame after the batch was handed over, starts anew.
    CadroValue number = {};
    number.type = kCadroNumber;
    number.number = 22.5;
    wire::Out fields;
    fields.Value(number);
    EXPECT_FALSE(out.ExtendLast(wire::Kind::Data, fields.View(), 1)); // the last frame is a Subscribe
    out.Begin(wire::Kind::Data);
    out.Raw(fields.View().data(), fields.View().size());
    out.U32(1);
    out.End();
    EXPECT_TRUE(out.ExtendLast(wire::Kind::Data, fields.View(), 2));
    wire::Out other;
    number.number = 22.25;
    other.Value(number);
    EXPECT_FALSE(out.ExtendLast(wire::Kind::Data, other.View(), 3));
    std::string bytes;
    out.Take(bytes);
    number.number = 22.5;
    EXPECT_FALSE(out.ExtendLast(wire::Kind::Data, fields.View(), 3));

    // Fields packed on the stack are the bytes that Out writes.
    wire::PackedFields packed;
    ASSERT_TRUE(packed.Pack(7, number, 1, 2, 3));
    wire::Out written;
    written.U32(7);
    written.Value(number);
    written.U32(1);
    written.U32(2);
    written.U32(3);
    EXPECT_EQ(packed.View(), written.View());
    CadroValue yes = {};
    yes.type = kCadroBoolean;
    yes.boolean = 1;
    ASSERT_TRUE(packed.Pack(7, yes, 0, 0, 0));
    EXPECT_EQ(packed.View().size(), 4u + 4 + 1 + 12);

    // Delivered one byte at a time, the frames come out whole and in order.
    std::string buffer;
    std::vector<wire::Kind> kinds;
    std::wstring url;
    double value = 0;
    std::vector<uint32_t> ids;
    for (char c : bytes) {
        buffer.push_back(c);
        ASSERT_TRUE(wire::TakeFrames(buffer, [&](wire::Kind kind, wire::In in) {
            kinds.push_back(kind);
            if (kind == wire::Kind::Subscribe) {
                EXPECT_EQ(in.U32(), 7u);
                EXPECT_EQ(in.U32(), 0x00400001u);
                url = in.Text();
            } else {
                CadroValue v;
                in.Value(v);
                value = v.number;
                while (in.Ok() && !in.AtEnd())
                    ids.push_back(in.U32());
            }
            EXPECT_TRUE(in.Ok());
        }));
    }
    EXPECT_EQ(kinds, (std::vector<wire::Kind>{wire::Kind::Subscribe, wire::Kind::Data}));
    EXPECT_EQ(url, L"\\\\HOST\\proc1\\Setpoints.temperature");
    EXPECT_EQ(value, 22.5);
    EXPECT_EQ(ids, (std::vector<uint32_t>{1, 2}));
    EXPECT_TRUE(buffer.empty());

    // A text whose length runs past the frame, and fields read past its end.
    wire::Out lying;
    lying.Begin(wire::Kind::List);
    lying.U32(1);
    lying.U32(1000000); // characters announced, none sent
    lying.End();
    lying.Take(buffer);
    bool handled = false;
    ASSERT_TRUE(wire::TakeFrames(buffer, [&](wire::Kind, wire::In in) {
        handled = true;
        EXPECT_EQ(in.U32(), 1u);
        EXPECT_TRUE(in.Text().empty());
        EXPECT_FALSE(in.Ok());
        EXPECT_EQ(in.U32(), 0u); // and stays refused
    }));
    EXPECT_TRUE(handled);

    // A length no peer of ours would send: the connection is given up.
    std::string garbage = "\xff\xff\xff\x7f"
                          "abc";
    EXPECT_FALSE(wire::TakeFrames(garbage, [](wire::Kind, wire::In) { FAIL(); }));
    std::string empty("\0\0\0\0x", 5);
    EXPECT_FALSE(wire::TakeFrames(empty, [](wire::Kind, wire::In) { FAIL(); }));

    // The member URLs a listing lets a library subscribe to without asking.
    EXPECT_EQ(wire::MemberUrl(L"\\\\H\\p\\Obj", L"cosine-Cosine wave"), L"\\\\H\\p\\Obj.cosine");
    EXPECT_EQ(wire::MemberUrl(L"\\\\H\\p\\Obj", L"(implicit)"), L"\\\\H\\p\\Obj");
    // Their hashes, made without building them, are those of the URLs.
    const std::wstring obj = L"\\\\H\\p\\Obj";
    for (const wchar_t *name : {L"cosine-Cosine wave", L"(implicit)", L"plain", L"-", L"a-b-c"})
        EXPECT_EQ(wire::MemberUrlHash(wire::UrlHash(obj), name), wire::UrlHash(wire::MemberUrl(obj, name))) << name;
}

// The set of member URLs that listings confirmed, by hash: what went in is
// found through growth, nothing else is, and clearing forgets all.
TEST(Wire, ConfirmedUrlSetKeepsWhatWentInThroughGrowth)
{
    HashSet64 set;
    EXPECT_FALSE(set.Contains(0));
    for (uint64_t i = 0; i < 5000; ++i)
        set.Insert(i * 0x9E3779B97F4A7C15ull); // includes 0
    set.Insert(0x9E3779B97F4A7C15ull);         // again
    EXPECT_EQ(set.Size(), 5000u);
    for (uint64_t i = 0; i < 5000; ++i)
        ASSERT_TRUE(set.Contains(i * 0x9E3779B97F4A7C15ull)) << i;
    EXPECT_FALSE(set.Contains(5000 * 0x9E3779B97F4A7C15ull));
    EXPECT_FALSE(set.Contains(12345));
    set.Clear();
    EXPECT_EQ(set.Size(), 0u);
    EXPECT_FALSE(set.Contains(0x9E3779B97F4A7C15ull));
}

// The node's flat tables of feeds and memberships against a map that is
// known to work: a long random run of insertions and erasures, with keys
// that crowd a few homes (runs that wrap around the table's end, erasures in
// their middle), agrees at every step; clearing forgets all.
TEST(Wire, FlatMapAgreesWithAReferenceMapThroughGrowthAndErasure)
{
    FlatMap<uint32_t, uint32_t, UINT32_MAX> map;
    std::unordered_map<uint32_t, uint32_t> reference;
    std::mt19937 random(7);
    for (int step = 0; step < 200000; ++step) {
        // Few distinct keys at first (dense runs), more later (growth).
        uint32_t key = random() % (step < 50000 ? 64u : 20000u);
        switch (random() % 3) {
        case 0:
        case 1:
            map[key] = static_cast<uint32_t>(step);
            reference[key] = static_cast<uint32_t>(step);
            break;
        case 2:
            ASSERT_EQ(map.Erase(key), reference.erase(key) == 1) << "step " << step;
            break;
        }
        uint32_t probe = random() % 20000u;
        uint32_t *found = map.Find(probe);
        auto it = reference.find(probe);
        ASSERT_EQ(found != nullptr, it != reference.end()) << "step " << step << ", key " << probe;
        if (found) {
            ASSERT_EQ(*found, it->second);
        }
        ASSERT_EQ(map.Size(), reference.size());
    }
    for (auto &[key, value] : reference)
        ASSERT_TRUE(map.Find(key) && *map.Find(key) == value) << key;
    map.Clear();
    EXPECT_EQ(map.Size(), 0u);
    EXPECT_EQ(map.Find(reference.begin()->first), nullptr);
    EXPECT_FALSE(map.Erase(1));
}

// The node's index of shared feeds, whose keys live in the feeds: against a
// reference map through growth and erasures in the middle of runs, a key
// that another handle has keeps the first one, and an erasure by a handle
// that is not the indexed one changes nothing.
TEST(Wire, FlatIndexFindsEachHandleByTheKeyItsObjectHolds)
{
    std::vector<uint64_t> keys(4001); // by handle; handle 0 is never used
    FlatIndex index([&](uint32_t handle) { return keys.at(handle); });
    std::unordered_map<uint64_t, uint32_t> reference;
    std::mt19937 random(11);
    for (int step = 0; step < 200000; ++step) {
        uint32_t handle = 1 + random() % 4000u;
        // Few distinct keys at first (crowded runs), more later (growth).
        uint64_t key = (random() % (step < 50000 ? 48u : 6000u)) * 0x100000001ull;
        auto indexed = reference.find(keys[handle]);
        bool isIndexed = indexed != reference.end() && indexed->second == handle;
        if (isIndexed) {
            index.Erase(handle, keys[handle]);
            reference.erase(indexed);
        } else {
            // A handle that is not indexed may change its key; one that is
            // may not.
            keys[handle] = key;
            bool taken = reference.count(key) && reference[key] != handle;
            ASSERT_EQ(index.Insert(handle, key), !taken) << "step " << step;
            if (!taken)
                reference[key] = handle;
            // Erasing by a handle that is not the indexed one: nothing.
            uint32_t other = handle % 4000u + 1;
            if (reference[key] != other)
                index.Erase(other, key);
        }
        uint64_t probe = (random() % 6000u) * 0x100000001ull;
        auto it = reference.find(probe);
        ASSERT_EQ(index.Find(probe), it == reference.end() ? 0u : it->second) << "step " << step;
        ASSERT_EQ(index.Size(), reference.size());
    }
    index.Clear();
    EXPECT_EQ(index.Size(), 0u);
    EXPECT_EQ(index.Find(reference.begin()->first), 0u);
}

// A catalogue that arrives after the network changed is out of date: it is
// refused and the next subscriber fetches anew; the change also forgets what
// listings confirmed.
TEST(Wire, ACatalogueFetchedAcrossAChangeIsRefused)
{
    KnownMembers known;
    known.AddListed({11, 12});
    unsigned ticket = known.BeginFetch();
    EXPECT_EQ(known.State(), KnownMembers::Catalogue::Fetching);
    known.Forget();
    EXPECT_FALSE(known.Fetched(ticket, true, {3, 1, 2}));
    EXPECT_EQ(known.State(), KnownMembers::Catalogue::Stale);
    EXPECT_FALSE(known.Listed(11));

    ticket = known.BeginFetch();
    EXPECT_TRUE(known.Fetched(ticket, true, {3, 1, 2})); // unsorted as it came
    EXPECT_EQ(known.State(), KnownMembers::Catalogue::Current);
    EXPECT_TRUE(known.InCatalogue(1) && known.InCatalogue(2) && known.InCatalogue(3));
    EXPECT_FALSE(known.InCatalogue(4));
    ticket = known.BeginFetch();
    EXPECT_TRUE(known.Fetched(ticket, false, {}));
    EXPECT_EQ(known.State(), KnownMembers::Catalogue::Refused);
}

// The node keeps two hashes of a URL instead of the URL: they differ in
// what they take apart.
TEST(Wire, TheUrlsSecondHashIsNotTheFirst)
{
    EXPECT_NE(wire::UrlCheck(L"\\\\.\\p\\o.a"), wire::UrlCheck(L"\\\\.\\p\\o.b"));
    EXPECT_NE(wire::UrlCheck(L"ab"), wire::UrlCheck(L"ba"));
    EXPECT_NE(wire::UrlCheck(L""), wire::UrlCheck(std::wstring(1, L'\0')));
    EXPECT_NE(wire::UrlCheck(L"x"), wire::UrlHash(L"x"));
}

// A local object's listing says which members a library may subscribe to by
// the URL it builds from the listing, without a lookup of each URL: the
// plainly named ones, an implicit one and one with a description.
TEST(Wire, AListingNamesTheMembersItsUrlsReach)
{
    Network network(L"HOST");
    auto machine = std::make_unique<Machine>();
    machine->name = L"HOST";
    machine->processes.push_back(std::make_unique<Process>());
    machine->processes.back()->name = L"p";
    network.Machines().push_back(std::move(machine));
    const std::wstring objectUrl = L"\\\\.\\p\\o";
    for (const wchar_t *name : {L"num", L"(implicit)", L"dash-With a description"}) {
        auto member = MemberPtr::Make();
        member->name = name;
        std::wstring text = name;
        member->idPart = text == L"(implicit)" ? L"" : text.substr(0, text.find(L'-'));
        std::wstring error;
        ASSERT_TRUE(network.AddMember(objectUrl, member, error)) << error;
    }
    std::vector<BrowseEntry> entries;
    ASSERT_TRUE(network.List(objectUrl, entries));
    ASSERT_EQ(entries.size(), 3u);
    for (const BrowseEntry &e : entries) {
        EXPECT_TRUE(e.named) << e.name;
        EXPECT_TRUE(network.FindMember(wire::MemberUrl(objectUrl, e.name))) << e.name;
    }
}

TEST(Wire, TheCatalogueNamesWhatPlainSpellingsReachAndNothingElse)
{
    Network network(L"HOST");
    for (const wchar_t *name : {L"HOST", L"Other"}) {
        auto machine = std::make_unique<Machine>();
        machine->name = name;
        machine->processes.push_back(std::make_unique<Process>());
        machine->processes.back()->name = L"p";
        network.Machines().push_back(std::move(machine));
    }
    auto add = [&](const std::wstring &objectUrl, const std::wstring &name) {
        auto member = MemberPtr::Make();
        member->name = name;
        member->idPart = name == L"(implicit)" ? L"" : name.substr(0, name.find(L'-'));
        std::wstring error;
        ASSERT_TRUE(network.AddMember(objectUrl, member, error)) << error;
    };
    for (const wchar_t *name : {L"num", L"(implicit)", L"dash-With a description"})
        add(L"\\\\.\\p\\o", name);
    add(L"\\\\.\\p\\o\\sub", L"x");
    add(L"\\\\.\\p\\'a.b'", L"y"); // only a quoted spelling reaches it
    add(L"\\\\Other\\p\\o", L"num");
    network.Machines().back()->node = L"127.0.0.1:1"; // another node's machine

    std::vector<uint64_t> catalogue;
    network.Catalogue(catalogue);
    auto listed = [&](const wchar_t *url) {
        return std::binary_search(catalogue.begin(), catalogue.end(), wire::CatalogueHash(url));
    };
    // What the library takes for granted: a hit names a member.
    for (const wchar_t *url : {L"\\\\.\\p\\o.num", L"\\\\host\\p\\o.num", L"\\\\HoSt\\p\\o", L"\\\\HOST\\p\\o.dash",
                               L"\\\\.\\p\\o\\sub.x"}) {
        EXPECT_TRUE(listed(url)) << url;
        EXPECT_TRUE(network.FindMember(url)) << url;
    }
    // Spellings the network does not take, or takes only quoted, and the
    // other node's machine: left to that node's answer.
    for (const wchar_t *url : {L"\\\\.\\P\\o.num", L"\\\\.\\p\\o.Num", L"\\\\.\\p\\o.dash-With a description",
                               L"\\\\.\\p\\a.b.y", L"\\\\.\\p\\o.", L"\\\\Other\\p\\o.num", L"\\\\.\\p\\o\\sub"})
        EXPECT_FALSE(listed(url)) << url;
    // Four members, each under the host's name and under ".", once.
    EXPECT_EQ(catalogue.size(), 8u);
    EXPECT_TRUE(std::is_sorted(catalogue.begin(), catalogue.end()));
}

TEST(Wire, AFeedKeepsItsUrlAndACopyTakesItWithTheMembersState)
{
    // The URL lives in the feed's block, a byte a character when it is
    // ASCII: it must come back whole either way, and in a copy (the copies
    // that members take when the node drops a feed subscribe again by it).
    for (std::wstring url : {std::wstring(L"\\\\HOST\\proc1\\Setpoints.temperature"),
                             std::wstring(L"\\\\HOST\\Anlage\\Kessel\u00e4.Druck\u4e2d"),
                             std::wstring(L"\\\\HOST\\p\\o.") + std::wstring(10000, L'x'), std::wstring()}) {
        std::unique_ptr<LinkFeed> feed(LinkFeed::Create(url.c_str()));
        ASSERT_TRUE(feed);
        EXPECT_EQ(feed->Url(), url);
        CadroValue value = {};
        value.type = kCadroNumber;
        value.number = 42.5;
        feed->id = 7;
        feed->mirror.Remember(kCadroHasValue | kCadroHasQuality | kCadroHasTime, value, 1, 11, 22);

        std::unique_ptr<LinkFeed> copy(LinkFeed::CopyOf(*feed));
        ASSERT_TRUE(copy);
        EXPECT_EQ(copy->Url(), url);
        EXPECT_EQ(copy->id, 0u);
        EXPECT_EQ(copy->head, 0u);
        EXPECT_EQ(copy->members, 0u);
        EXPECT_TRUE(copy->Alone());
        uint32_t flags = 0;
        CadroValue recalled = {};
        int32_t error = 0;
        FILETIME time = {};
        ASSERT_EQ(copy->mirror.Recall(&flags, &recalled, &error, &time), S_OK);
        EXPECT_EQ(recalled.type, kCadroNumber);
        EXPECT_EQ(recalled.number, 42.5);
        EXPECT_NE(error, 0);
        EXPECT_EQ(time.dwLowDateTime, 11u);
        EXPECT_EQ(time.dwHighDateTime, 22u);
    }
}

TEST(Wire, ASlotTableFindsWhatIsInItAndTellsAReusedSlotFromItsPredecessor)
{
    struct Thing {
        uint64_t value;
    };
    // The fewest bits of slot that leave a generation of at most 15 bits:
    // ids 1 .. kMask - 1 (all ones is none).
    constexpr uint32_t kBits = 17, kMask = (1u << kBits) - 1;
    SlotTable<Thing, kBits> table;
    std::vector<uint32_t> ids;
    for (;;) {
        uint32_t id = 0;
        void *place = table.Take(id);
        if (!place)
            break;
        new (place) Thing{ids.size()};
        ids.push_back(id);
    }
    ASSERT_EQ(ids.size(), kMask - 1);
    EXPECT_EQ(ids.front() & kMask, 1u);
    EXPECT_EQ(ids.back() & kMask, kMask - 1);
    for (uint32_t id : ids)
        ASSERT_EQ(table.Find(id)->value, (id & kMask) - 1);
    EXPECT_EQ(table.Find(0), nullptr);
    EXPECT_EQ(table.Find(kMask), nullptr);
    EXPECT_EQ(table.Find(ids[3] ^ (1u << kBits)), nullptr) << "another generation of the slot";

    // Out of the table: no longer found, not listed, its place still taken.
    table.Leave(ids[3]);
    EXPECT_EQ(table.Find(ids[3]), nullptr);
    size_t listed = 0;
    table.ForEach([&](Thing *thing) {
        EXPECT_NE(thing->value, 3u);
        ++listed;
    });
    EXPECT_EQ(listed, kMask - 2);
    uint32_t none = 0;
    EXPECT_EQ(table.Take(none), nullptr);

    // Given back, the slot serves again under the next generation; a
    // value for the old id finds nothing.
    table.Give(ids[3]);
    uint32_t again = 0;
    void *place = table.Take(again);
    ASSERT_NE(place, nullptr);
    new (place) Thing{99};
    EXPECT_EQ(again & kMask, ids[3] & kMask);
    EXPECT_NE(again, ids[3]);
    EXPECT_EQ(table.Find(ids[3]), nullptr);
    EXPECT_EQ(table.Find(again)->value, 99u);
    ids[3] = again;

    // Every place back: the blocks go, and the slots start over in a new
    // generation, so that no id given before is found.
    for (uint32_t id : ids) {
        table.Leave(id);
        table.Give(id);
    }
    EXPECT_EQ(table.Live(), 0u);
    uint32_t fresh = 0;
    ASSERT_NE(table.Take(fresh), nullptr);
    EXPECT_EQ(fresh & kMask, 1u);
    for (uint32_t id : ids)
        EXPECT_EQ(table.Find(id), nullptr);
    EXPECT_NE(table.Find(fresh), nullptr);

    // Cleared at once (a node session's end): nothing is found, and the
    // next place starts over in yet another generation.
    table.Clear();
    EXPECT_EQ(table.Live(), 0u);
    EXPECT_EQ(table.Find(fresh), nullptr);
    uint32_t afterClear = 0;
    ASSERT_NE(table.Take(afterClear), nullptr);
    EXPECT_EQ(afterClear & kMask, 1u);
    EXPECT_NE(afterClear, fresh);
    EXPECT_EQ(table.Live(), 1u);
}

TEST(Wire, AFixedPoolGivesEachLiveObjectItsOwnPlaceAndLetsGoOfItsBlocksWhenEmpty)
{
    struct Thing {
        uint64_t a, b, c;
    };
    FixedPool<Thing, 64> pool;
    std::vector<Thing *> things;
    for (int i = 0; i < 200; ++i) {
        auto *thing = static_cast<Thing *>(pool.Allocate());
        ASSERT_NE(thing, nullptr);
        EXPECT_EQ(reinterpret_cast<uintptr_t>(thing) % alignof(Thing), 0u);
        *thing = {uint64_t(i), uint64_t(i) * 3, uint64_t(i) * 7};
        things.push_back(thing);
    }
    EXPECT_EQ(pool.Blocks(), 4u);
    EXPECT_EQ(std::set<Thing *>(things.begin(), things.end()).size(), things.size());
    // Freed in any order, the places serve again before a block is added,
    // and what lives is never touched.
    std::mt19937 random(7);
    std::shuffle(things.begin(), things.end(), random);
    for (int i = 0; i < 100; ++i)
        pool.Free(things[i]);
    things.erase(things.begin(), things.begin() + 100);
    for (int i = 0; i < 100; ++i) {
        auto *thing = static_cast<Thing *>(pool.Allocate());
        *thing = {~0ull, ~0ull, ~0ull};
        things.push_back(thing);
    }
    EXPECT_EQ(pool.Blocks(), 4u);
    EXPECT_EQ(std::set<Thing *>(things.begin(), things.end()).size(), things.size());
    for (size_t i = 0; i < 100; ++i)
        EXPECT_EQ(things[i]->b, things[i]->a * 3);
    // The last one freed takes the blocks with it.
    for (Thing *thing : things)
        pool.Free(thing);
    EXPECT_EQ(pool.Live(), 0u);
    EXPECT_EQ(pool.Blocks(), 0u);
    pool.Free(nullptr);
    EXPECT_EQ(pool.Live(), 0u);

    // Threads that take and give places at once never share one.
    std::vector<std::thread> threads;
    std::atomic<int> shared{0};
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            std::vector<Thing *> mine;
            for (int round = 0; round < 2000; ++round) {
                auto *thing = static_cast<Thing *>(pool.Allocate());
                *thing = {uint64_t(t), uint64_t(round), 0};
                mine.push_back(thing);
                if (round % 3 == 2) {
                    for (Thing *m : mine)
                        if (m->a != uint64_t(t))
                            ++shared;
                    pool.Free(mine.front());
                    mine.erase(mine.begin());
                }
            }
            for (Thing *m : mine) {
                if (m->a != uint64_t(t))
                    ++shared;
                pool.Free(m);
            }
        });
    for (std::thread &thread : threads)
        thread.join();
    EXPECT_EQ(shared.load(), 0);
    EXPECT_EQ(pool.Live(), 0u);
    EXPECT_EQ(pool.Blocks(), 0u);
}

namespace {
// A pipe that keeps what is written to it, in the order written.
class KeptChannel : public Channel {
public:
    bool Read(std::string &) override { return false; }
    bool Write(const std::string &bytes) override
    {
        std::lock_guard<std::mutex> l(m_lock);
        m_bytes += bytes;
        return true;
    }
    void Close() override {}
    // The frames' numbers, in the order their frames were written.
    std::vector<uint32_t> Numbers()
    {
        std::lock_guard<std::mutex> l(m_lock);
        std::string buffer = m_bytes;
        std::vector<uint32_t> numbers;
        wire::TakeFrames(buffer, [&](wire::Kind, wire::In in) { numbers.push_back(in.U32()); });
        return numbers;
    }

private:
    std::mutex m_lock;
    std::string m_bytes;
};

std::vector<uint32_t> Count(uint32_t from, uint32_t to)
{
    std::vector<uint32_t> numbers;
    for (uint32_t i = from; i < to; ++i)
        numbers.push_back(i);
    return numbers;
}
} // namespace

// The writer holds frames of a burst back briefly so that they travel
// together: a lone frame must still go without anything behind it, a flush
// must not wait for the writer's pause, and a stop in the middle of the
// pause must write what is queued and return.
TEST(Wire, AQueuesWriterHoldsNothingBackForGoodAndAStopInItsPauseWritesEverything)
{
    auto channel = std::make_shared<KeptChannel>();
    auto push = [](FrameQueue &queue, uint32_t number) {
        return queue.Push(wire::Kind::Status, [&](wire::Out &out) { out.U32(number); });
    };
    // What reached the channel once it holds count frames, or after 30 s.
    auto waitFor = [](KeptChannel &kept, size_t count) {
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(30);
        while (kept.Numbers().size() < count && std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        return kept.Numbers();
    };
    {
        FrameQueue queue;
        queue.Attach(channel);
        // A frame alone, then one right after it (within the pause), each
        // written by the writer with nothing more coming.
        ASSERT_TRUE(push(queue, 0));
        EXPECT_EQ(waitFor(*channel, 1), Count(0, 1));
        ASSERT_TRUE(push(queue, 1));
        EXPECT_EQ(waitFor(*channel, 2), Count(0, 2));
        // A burst, then a flush from this thread: everything, in order.
        for (uint32_t i = 2; i < 2000; ++i)
            ASSERT_TRUE(push(queue, i));
        queue.Flush();
        EXPECT_EQ(waitFor(*channel, 2000), Count(0, 2000));
        // A burst stopped at once, most likely in the writer's pause.
        for (uint32_t i = 2000; i < 3000; ++i)
            ASSERT_TRUE(push(queue, i));
        queue.Stop(true);
        EXPECT_EQ(channel->Numbers(), Count(0, 3000));
    }
    // Detached in the pause: the queued frames are dropped, the queue ends.
    auto second = std::make_shared<KeptChannel>();
    FrameQueue queue;
    queue.Attach(second);
    ASSERT_TRUE(push(queue, 0));
    waitFor(*second, 1);
    ASSERT_TRUE(push(queue, 1));
    queue.Detach();
    EXPECT_FALSE(push(queue, 2));
    queue.Stop(true);
    std::vector<uint32_t> written = second->Numbers();
    ASSERT_FALSE(written.empty());
    EXPECT_EQ(written.front(), 0u);
    EXPECT_LE(written.size(), 2u);
}
