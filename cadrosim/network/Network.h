#pragma once
// The simulated network's topology: machines, processes, objects (which may
// nest) and data members, with each member's value source and current value.
// Not thread-safe: the engine guards it.
#include "SimValue.h"
#include "SubscriberList.h"

#include <atomic>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

namespace cadrosim {

class Shard;
struct Subscription;

enum class SourceKind { Const, Sine, Cosine, Ramp, Square, Random, Counter, Toggle };

struct Source {
    SourceKind kind = SourceKind::Const;
    unsigned period = 1000; // ms between updates; 0: only on change
    double cycle = 10000;   // ms of one waveform cycle
    double amplitude = 1;
    double offset = 0;
    double min = 0;
    double max = 1;
    double step = 1;
};

struct Machine;

struct Member {
    // What a tick reads and writes comes first, in the member's first two
    // cache lines (a node ticks ten thousand members at 10 ms, each a cache
    // miss); the names, which only lookups and listings read, last.
    // Guarded by the member's shard.
    bool hasValue = false;
    bool good = true;
    bool stalled = false;
    bool removed = false;
    bool scheduled = false;
    uint32_t type = kCadroNumber;
    uint32_t cadenceSlot = 0;     // its place in its shard's cadence, while scheduled
    SubscriberList subscriptions; // active ones
    Machine *machine = nullptr;
    FILETIME time = {};
    SimValue value;
    Source source;
    Shard *shard = nullptr;

    uint32_t access = 3; // bit 0 readable, bit 1 writable
    std::wstring name;   // as browsed, e.g. "cosine-Cosine wave"
    std::wstring idPart; // as in URLs, e.g. "cosine"; empty for "(implicit)"

private:
    friend class MemberPtr;
    std::atomic<uint32_t> m_refs{0}; // MemberPtr's
};

// A counted reference to a member, as std::shared_ptr would be, in one
// pointer rather than two: an engine subscription holds one (a node holds
// a subscription for every member a library subscribed to), and the
// network, a shard's cadence and a command hold others. The last reference
// to go deletes the member.
class MemberPtr {
public:
    MemberPtr() = default;
    MemberPtr(std::nullptr_t) {}
    MemberPtr(const MemberPtr &other) : m_member(other.m_member) { AddRef(); }
    MemberPtr(MemberPtr &&other) noexcept : m_member(other.m_member) { other.m_member = nullptr; }
    MemberPtr &operator=(MemberPtr other) noexcept
    {
        std::swap(m_member, other.m_member);
        return *this;
    }
    ~MemberPtr() { reset(); }

    // A new member, with this one reference; throws std::bad_alloc when
    // memory is short, as std::make_shared does.
    static MemberPtr Make();

    void reset()
    {
        Member *member = m_member;
        m_member = nullptr;
        if (member && member->m_refs.fetch_sub(1, std::memory_order_acq_rel) == 1)
            delete member;
    }
    Member *get() const { return m_member; }
    Member *operator->() const { return m_member; }
    Member &operator*() const { return *m_member; }
    explicit operator bool() const { return m_member != nullptr; }
    bool operator==(const MemberPtr &other) const { return m_member == other.m_member; }
    bool operator!=(const MemberPtr &other) const { return m_member != other.m_member; }

private:
    void AddRef()
    {
        if (m_member)
            m_member->m_refs.fetch_add(1, std::memory_order_relaxed);
    }

    Member *m_member = nullptr;
};

inline MemberPtr MemberPtr::Make()
{
    MemberPtr made;
    made.m_member = new Member;
    made.AddRef();
    return made;
}

// Objects and members are listed in the order they were added and found
// by name through an index, so that a lookup costs the same however many
// siblings there are.
struct Object {
    std::wstring name;
    std::vector<std::unique_ptr<Object>> objects;
    std::vector<MemberPtr> members;
    std::unordered_map<std::wstring, Object *> objectIndex;
    std::unordered_map<std::wstring, MemberPtr> memberIndex; // by part
};

struct Process {
    std::wstring name;
    std::vector<std::unique_ptr<Object>> objects;
    std::unordered_map<std::wstring, Object *> objectIndex;
};

struct Machine {
    std::wstring name;
    std::wstring node;              // "host:port" of the node that serves it, when not this one
    class NodeLink *link = nullptr; // the engine's link to that node
    std::atomic<bool> connected{true};
    std::vector<std::unique_ptr<Process>> processes;
};

// One entry of a browse listing.
struct BrowseEntry {
    std::wstring name;
    wchar_t kind = L'\\';
    bool leaf = false;
    uint16_t dataType = 0;
    uint16_t access = 3;
    // A member of a local object whose URL, as a library builds it from
    // this listing (wire::MemberUrl), is known to name a member; false when
    // that is not known without a lookup by URL.
    bool named = false;
};

class Network {
public:
    // The name that stands for the local machine: "$HOST" in descriptions,
    // "." in URLs.
    explicit Network(std::wstring hostName = L"");

    const std::wstring &HostName() const { return m_host; }
    std::vector<std::unique_ptr<Machine>> &Machines() { return m_machines; }

    Machine *FindMachine(const std::wstring &name);
    // The member a URL names (an object's URL names its "(implicit)"
    // member); null when the network does not know it.
    MemberPtr FindMember(const std::wstring &url);
    // The children of a machine, process or object URL, or of "\" or "\\"
    // (the machines). False when the URL is unknown.
    bool List(const std::wstring &url, std::vector<BrowseEntry> &out);
    // Whether the URL a library builds from the listed name of one of
    // object's members is known to name a member (BrowseEntry::named).
    static bool NamesAMember(const Object &object, const Member &member);
    // The wire::CatalogueHash of every member of the machines served here,
    // as its plain spelling names it (a name that only a quoted spelling
    // reaches is left out): sorted, without repeats.
    void Catalogue(std::vector<uint64_t> &out) const;

    // The object an object URL names, created with its path when missing;
    // null (with error) when the URL names no process.
    Object *EnsureObject(const std::wstring &objectUrl, std::wstring &error);
    // Adds a member under an object URL (the object path is created when
    // missing); false when the URL names no process or the member exists.
    bool AddMember(const std::wstring &objectUrl, MemberPtr member, std::wstring &error);
    // Detaches the member from the tree and returns it.
    MemberPtr RemoveMember(const std::wstring &url);

    // Every member, for walks over the whole network.
    template <class F> void ForEachMember(F f)
    {
        for (auto &m : m_machines)
            for (auto &p : m->processes)
                for (auto &o : p->objects)
                    ForEachInObject(*o, *m, f);
    }

private:
    template <class F> static void ForEachInObject(Object &o, Machine &m, F &f)
    {
        for (auto &member : o.members)
            f(m, member);
        for (auto &sub : o.objects)
            ForEachInObject(*sub, m, f);
    }

    static void CatalogueObject(const Object &object, uint64_t parentHash, std::vector<uint64_t> &out);

    struct Path {
        Machine *machine = nullptr;
        Process *process = nullptr;
        std::vector<std::wstring> objects;
        std::wstring member; // after the last ".", if any
        bool hasMember = false;
    };
    bool ParseUrl(const std::wstring &url, Path &path);
    Object *FindObject(Process &process, const std::vector<std::wstring> &names, size_t count);
    // The object holding the member a URL names, and the member.
    Object *FindMemberSlot(const std::wstring &url, MemberPtr &member);

    std::wstring m_host;
    std::vector<std::unique_ptr<Machine>> m_machines;
};

// Splits a URL into its segments: "\\m\p\o1\o2.member" gives machine "m",
// then "p", "o1", "o2" and member "member". Quoted segments ('a''b') are
// unquoted. False when malformed.
bool SplitUrl(const std::wstring &url, std::wstring &machine, std::vector<std::wstring> &segments, std::wstring &member,
              bool &hasMember);

} // namespace cadrosim
