// The control commands of the simulated network, shared by the control pipe,
// the cadroctl tool and the tests.
#include "Engine.h"

#include "NetworkFile.h"
#include "NodeLink.h"

#include <algorithm>
#include <cwchar>
#include <iterator>
#include <sstream>

namespace cadrosim {

namespace {
std::wstring Error(const std::wstring &what)
{
    return L"error: " + what + L"\n";
}

// "now", a FILETIME number, or ISO 8601 UTC "YYYY-MM-DDTHH:MM:SS[.mmm]Z".
bool ParseTime(const std::wstring &text, FILETIME &out)
{
    if (text == L"now") {
        GetSystemTimeAsFileTime(&out);
        return true;
    }
    SYSTEMTIME st = {};
    unsigned y, mo, d, h, mi, s, ms = 0;
    wchar_t z = 0;
    if (swscanf(text.c_str(), L"%4u-%2u-%2uT%2u:%2u:%2u.%3u%lc", &y, &mo, &d, &h, &mi, &s, &ms, &z) == 8 ||
        (ms = 0, swscanf(text.c_str(), L"%4u-%2u-%2uT%2u:%2u:%2u%lc", &y, &mo, &d, &h, &mi, &s, &z) == 7)) {
        if (z != L'Z')
            return false;
        st.wYear = static_cast<WORD>(y);
        st.wMonth = static_cast<WORD>(mo);
        st.wDay = static_cast<WORD>(d);
        st.wHour = static_cast<WORD>(h);
        st.wMinute = static_cast<WORD>(mi);
        st.wSecond = static_cast<WORD>(s);
        st.wMilliseconds = static_cast<WORD>(ms);
        return SystemTimeToFileTime(&st, &out) != FALSE;
    }
    wchar_t *end = nullptr;
    unsigned long long raw = wcstoull(text.c_str(), &end, 10);
    if (text.empty() || *end)
        return false;
    out.dwLowDateTime = static_cast<DWORD>(raw);
    out.dwHighDateTime = static_cast<DWORD>(raw >> 32);
    return true;
}

std::wstring FormatTime(const FILETIME &ft)
{
    SYSTEMTIME st = {};
    FileTimeToSystemTime(&ft, &st);
    wchar_t text[40];
    swprintf(text, 40, L"%04u-%02u-%02uT%02u:%02u:%02u.%03uZ", st.wYear, st.wMonth, st.wDay, st.wHour, st.wMinute,
             st.wSecond, st.wMilliseconds);
    return text;
}

// Splits key=value options off the arguments.
bool Option(const std::wstring &arg, const wchar_t *key, std::wstring &value)
{
    std::wstring prefix = std::wstring(key) + L"=";
    if (arg.compare(0, prefix.size(), prefix) != 0)
        return false;
    value = arg.substr(prefix.size());
    return true;
}

const wchar_t kHelp[] = L"ok\n"
                        L"publish <url> <value> [quality=good|bad] [time=now|<ISO 8601 UTC>|<FILETIME>]\n"
                        L"add-member <object url> <name> [type=..] [access=..] [source=..] [period=..] [value=..]\n"
                        L"remove-member <url>\n"
                        L"disconnect <machine> | reconnect <machine>\n"
                        L"stall <url> | unstall <url>\n"
                        L"show <url> | browse <url> | list-subscriptions | status\n"
                        L"load <file> | reset (back to the network's description) | shutdown (a network node)\n";
} // namespace

std::wstring Engine::Execute(const std::wstring &command)
{
    std::vector<std::wstring> args;
    if (!Tokenize(command, args))
        return Error(L"unclosed quote");
    if (args.empty())
        return Error(L"empty command");
    std::wstring verb = args[0];
    args.erase(args.begin());
    if (std::wstring address = ServedElsewhere(verb, args); !address.empty())
        return Error(L"that machine is served by the node at " + address + L": run the command there");
    if (verb == L"publish")
        return Publish(args);
    if (verb == L"add-member")
        return AddMemberCommand(args);
    if (verb == L"remove-member")
        return RemoveMemberCommand(args);
    if (verb == L"disconnect" || verb == L"reconnect")
        return SetConnected(args, verb == L"reconnect");
    if (verb == L"stall" || verb == L"unstall")
        return SetStalled(args, verb == L"stall");
    if (verb == L"list-subscriptions")
        return ListSubscriptions();
    if (verb == L"show")
        return Show(args);
    if (verb == L"browse")
        return BrowseCommand(args);
    if (verb == L"status")
        return Status();
    if (verb == L"reset") {
        LoadInitialNetwork();
        return m_loadError.empty() ? L"ok\n" : Error(m_loadError);
    }
    if (verb == L"load") {
        if (args.size() != 1)
            return Error(L"usage: load <network description file>");
        std::wstring text, error;
        if (!ReadTextFile(args[0], text))
            return Error(L"cannot read " + args[0]);
        return Load(text, error) ? L"ok\n" : Error(args[0] + L": " + error);
    }
    if (verb == L"shutdown") {
        std::function<void()> shutdown;
        {
            std::lock_guard<SlimMutex> l(m_shutdownLock);
            shutdown = m_shutdown;
        }
        if (!shutdown)
            return Error(L"this network is part of its program, not a network node: it ends with the program");
        shutdown();
        return L"ok\n";
    }
    if (verb == L"help")
        return kHelp;
    return Error(L"unknown command '" + verb + L"' (try help)");
}

std::wstring Engine::ServedElsewhere(const std::wstring &verb, const std::vector<std::wstring> &args)
{
    static const wchar_t *const onUrls[] = {L"publish", L"add-member", L"remove-member", L"stall",
                                            L"unstall", L"show",       L"disconnect",    L"reconnect"};
    bool onUrl = std::any_of(std::begin(onUrls), std::end(onUrls), [&](const wchar_t *v) { return verb == v; });
    if (!onUrl || args.empty())
        return L"";
    bool machineOnly = verb == L"disconnect" || verb == L"reconnect";
    NodeLink *link = RemoteNodeOf(machineOnly ? L"\\\\" + args[0] : args[0]);
    return link ? link->Address() : L"";
}

std::wstring Engine::Publish(const std::vector<std::wstring> &args)
{
    if (args.size() < 2)
        return Error(L"usage: publish <url> <value> [quality=good|bad] [time=...]");
    Machine *machine = nullptr;
    auto member = FindMember(args[0], &machine);
    if (!member)
        return Error(L"unknown data member " + args[0]);
    SimValue value;
    if (!ParseValue(member->type, args[1], value))
        return Error(L"'" + args[1] + L"' is not a " + TypeName(member->type));
    bool good = true;
    FILETIME time;
    GetSystemTimeAsFileTime(&time);
    for (size_t i = 2; i < args.size(); ++i) {
        std::wstring v;
        if (Option(args[i], L"quality", v) && (v == L"good" || v == L"bad"))
            good = v == L"good";
        else if (Option(args[i], L"time", v) && ParseTime(v, time))
            continue;
        else
            return Error(L"bad option '" + args[i] + L"'");
    }
    Shard &shard = *member->shard;
    std::lock_guard<SlimMutex> l(shard.lock);
    member->value = value;
    member->hasValue = true;
    member->good = good;
    member->time = time;
    for (Subscription *s : member->subscriptions)
        if (s->active)
            shard.Post(s, EventKind::Value);
    return L"ok\n";
}

std::wstring Engine::AddMemberCommand(const std::vector<std::wstring> &args)
{
    if (args.size() < 2)
        return Error(L"usage: add-member <object url> <name> [key=value...]");
    auto member = MemberPtr::Make();
    std::wstring error;
    if (!ParseMemberSpec(args, 1, *member, error))
        return Error(error);
    {
        std::lock_guard<SlimMutex> l(m_networkLock);
        member->shard = m_shards[NextShard()].get();
        if (!m_network->AddMember(args[0], member, error))
            return Error(error);
    }
    NotifyTopologyChanged();
    return L"ok\n";
}

std::wstring Engine::RemoveMemberCommand(const std::vector<std::wstring> &args)
{
    if (args.size() != 1)
        return Error(L"usage: remove-member <url>");
    MemberPtr member;
    {
        std::lock_guard<SlimMutex> l(m_networkLock);
        member = m_network->RemoveMember(args[0]);
    }
    if (!member)
        return Error(L"unknown data member " + args[0]);
    {
        // Its subscribers hear that the item is gone and get nothing more.
        std::lock_guard<SlimMutex> l(member->shard->lock);
        member->removed = true;
        for (Subscription *s : member->subscriptions) {
            s->active = false;
            member->shard->Post(s, EventKind::Status, kCadroStatusSubscribeFailed);
        }
    }
    NotifyTopologyChanged();
    return L"ok\n";
}

std::wstring Engine::SetConnected(const std::vector<std::wstring> &args, bool connected)
{
    if (args.size() != 1)
        return Error(L"usage: disconnect|reconnect <machine>");
    std::vector<MemberPtr> members;
    {
        std::lock_guard<SlimMutex> l(m_networkLock);
        Machine *machine = m_network->FindMachine(args[0]);
        if (!machine)
            return Error(L"unknown machine " + args[0]);
        if (machine->connected == connected)
            return L"ok\n";
        machine->connected = connected;
        m_network->ForEachMember([&](Machine &m, MemberPtr &member) {
            if (&m == machine)
                members.push_back(member);
        });
    }
    for (auto &member : members) {
        Shard &shard = *member->shard;
        std::lock_guard<SlimMutex> l(shard.lock);
        for (Subscription *s : member->subscriptions) {
            if (!connected) {
                s->active = false;
                shard.Post(s, EventKind::Status, kCadroStatusDisconnected);
                continue;
            }
            shard.Post(s, EventKind::Open);
        }
    }
    return L"ok\n";
}

std::wstring Engine::SetStalled(const std::vector<std::wstring> &args, bool stalled)
{
    if (args.size() != 1)
        return Error(L"usage: stall|unstall <url>");
    auto member = FindMember(args[0]);
    if (!member)
        return Error(L"unknown data member " + args[0]);
    std::lock_guard<SlimMutex> l(member->shard->lock);
    member->stalled = stalled;
    return L"ok\n";
}

std::wstring Engine::ListSubscriptions()
{
    std::wostringstream out;
    out << L"ok\n";
    std::lock_guard<SlimMutex> l(m_networkLock);
    m_network->ForEachMember([&](Machine &machine, MemberPtr &member) {
        std::lock_guard<SlimMutex> sl(member->shard->lock);
        if (member->subscriptions.empty())
            return;
        out << L"\\\\" << machine.name << L" " << member->name << L" subscriptions=" << member->subscriptions.size()
            << L" value=" << FormatValue(member->value) << L"\n";
    });
    out << L"total " << m_subscriptionCount.load() << L"\n";
    return out.str();
}

std::wstring Engine::Show(const std::vector<std::wstring> &args)
{
    if (args.size() != 1)
        return Error(L"usage: show <url>");
    auto member = FindMember(args[0]);
    if (!member)
        return Error(L"unknown data member " + args[0]);
    std::lock_guard<SlimMutex> l(member->shard->lock);
    std::wostringstream out;
    out << L"ok\n"
        << L"name " << member->name << L"\ntype " << TypeName(member->type) << L"\naccess "
        << (member->access == 3   ? L"rw"
            : member->access == 2 ? L"w"
                                  : L"r")
        << L"\nvalue " << (member->hasValue ? FormatValue(member->value) : L"(none yet)") << L"\nquality "
        << (member->good ? L"good" : L"bad") << L"\ntime " << FormatTime(member->time) << L"\nstalled "
        << (member->stalled ? L"yes" : L"no") << L"\nsubscriptions " << member->subscriptions.size() << L"\n";
    return out.str();
}

std::wstring Engine::BrowseCommand(const std::vector<std::wstring> &args)
{
    if (args.size() != 1)
        return Error(L"usage: browse <url>");
    std::vector<BrowseEntry> entries;
    if (!List(args[0], entries))
        return Error(L"unknown URL " + args[0]);
    std::wostringstream out;
    out << L"ok\n";
    for (const auto &e : entries) {
        out << e.kind << L" " << e.name;
        if (e.leaf)
            out << L"  (" << TypeName(e.dataType) << L", "
                << (e.access == 3   ? L"rw"
                    : e.access == 2 ? L"w"
                                    : L"r")
                << L")";
        out << L"\n";
    }
    return out.str();
}

std::wstring Engine::Status()
{
    std::wostringstream out;
    out << L"ok\nhost " << LocalHostName() << L"\nnetwork " << m_networkSource << L"\n";
    if (!m_loadError.empty())
        out << L"load error " << m_loadError << L"\n";
    std::lock_guard<SlimMutex> l(m_networkLock);
    for (auto &m : m_network->Machines()) {
        if (!m->node.empty())
            out << L"machine " << m->name << L" served by the node at " << m->node << L"\n";
        else
            out << L"machine " << m->name << (m->connected ? L" connected" : L" disconnected") << L"\n";
    }
    out << L"subscriptions " << m_subscriptionCount.load() << L"\n";
    out << L"browses " << m_browseCount.load() << L"\n";
    out << L"reads " << m_readCount.load() << L"\n";
    return out.str();
}

} // namespace cadrosim
