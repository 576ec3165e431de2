#include "NodeSession.h"

#include "SimValue.h"

#include <new>
#include <vector>

namespace cadrosim {

namespace {
// A library that reads nothing for this long is hung: its connection is
// dropped rather than the node's memory filled (it reconnects and
// subscribes again when it recovers).
constexpr size_t kLargestBacklog = 256u << 20;
const wchar_t kNoCommands[] = L"the node takes commands from its own machine only";

uint32_t IdOf(void *cookie)
{
    return static_cast<uint32_t>(reinterpret_cast<uintptr_t>(cookie));
}
} // namespace

NodeSession *NodeSession::Start(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended)
{
    return new (std::nothrow) NodeSession(engine, std::move(channel), fromNode, ended);
}

NodeSession::NodeSession(Engine &engine, std::shared_ptr<Channel> channel, bool fromNode, HANDLE ended)
    : m_engine(engine), m_channel(std::move(channel)), m_fromNode(fromNode), m_endedEvent(ended),
      m_queue(kLargestBacklog)
{
    m_queue.Attach(m_channel);
    m_reader = std::thread([this] { ReadLoop(); });
}

void NodeSession::Join()
{
    if (m_reader.joinable())
        m_reader.join();
}

template <class Fill> void NodeSession::Reply(Fill fill)
{
    m_queue.Push(wire::Kind::Reply, fill);
    m_queue.Flush();
}

void NodeSession::ReadLoop()
{
    std::string buffer;
    size_t consumed = 0;
    bool fine = true;
    while (fine && m_channel->Read(buffer))
        fine = wire::TakeFrames(buffer, consumed, [&](wire::Kind kind, wire::In in) {
            if (fine)
                fine = Handle(kind, in);
        });
    m_channel->Close();
    ReleaseAll();
    m_queue.Stop(false);
    m_ended = true;
    SetEvent(m_endedEvent);
}

void NodeSession::ReleaseAll()
{
    std::unordered_map<uint32_t, CadroDataItem *> subs;
    {
        std::lock_guard<SlimMutex> l(m_subsLock);
        subs.swap(m_subs);
    }
    for (auto &entry : subs)
        entry.second->Release();
}

bool NodeSession::Handle(wire::Kind kind, wire::In &in)
{
    switch (kind) {
    case wire::Kind::Subscribe:
        Subscribe(in);
        break;
    case wire::Kind::Unsubscribe:
        Unsubscribe(in.U32());
        break;
    case wire::Kind::Write: {
        uint32_t id = in.U32();
        CadroValue value;
        in.Value(value);
        if (CadroDataItem *item = in.Ok() ? Find(id) : nullptr) {
            item->Write(&value);
            item->Release();
        }
        ClearCadroValue(value);
        break;
    }
    case wire::Kind::List: {
        uint32_t request = in.U32();
        std::wstring url = in.Text();
        if (in.Ok())
            List(request, url);
        break;
    }
    case wire::Kind::Execute: {
        uint32_t request = in.U32();
        std::wstring command = in.Text();
        if (!in.Ok())
            break;
        // Another machine's node asks for values, never for commands: the
        // port must not let anyone who reaches it load or stop this node.
        std::wstring answer = m_fromNode ? L"error: " + std::wstring(kNoCommands) + L"\n" : m_engine.Execute(command);
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.Text(answer);
        });
        break;
    }
    case wire::Kind::Load: {
        uint32_t request = in.U32();
        std::wstring description = in.Text();
        if (!in.Ok())
            break;
        std::wstring error = kNoCommands;
        bool loaded = !m_fromNode && m_engine.Load(description, error);
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U8(loaded ? 1 : 0);
            out.Text(error);
        });
        break;
    }
    default:
        return false;
    }
    return in.Ok();
}

void NodeSession::Subscribe(wire::In &in)
{
    uint32_t request = in.U32();
    uint32_t id = in.U32();
    std::wstring url = in.Text();
    if (!in.Ok())
        return;
    CadroDataItem *item = nullptr;
    HRESULT hr =
        m_engine.Subscribe(url.c_str(), reinterpret_cast<void *>(static_cast<uintptr_t>(id)), this, &item, m_fromNode);
    if (SUCCEEDED(hr)) {
        CadroDataItem *previous = nullptr;
        {
            std::lock_guard<SlimMutex> l(m_subsLock);
            CadroDataItem *&slot = m_subs[id];
            previous = slot; // an id used twice: the later subscription wins
            slot = item;
        }
        if (previous)
            previous->Release();
    }
    if (request)
        Reply([&](wire::Out &out) {
            out.U32(request);
            out.U32(static_cast<uint32_t>(hr));
        });
}

void NodeSession::Unsubscribe(uint32_t id)
{
    CadroDataItem *item = nullptr;
    {
        std::lock_guard<SlimMutex> l(m_subsLock);
        auto it = m_subs.find(id);
        if (it == m_subs.end())
            return;
        item = it->second;
        m_subs.erase(it);
    }
    item->Release();
}

CadroDataItem *NodeSession::Find(uint32_t id)
{
    std::lock_guard<SlimMutex> l(m_subsLock);
    auto it = m_subs.find(id);
    if (it == m_subs.end())
        return nullptr;
    it->second->AddRef();
    return it->second;
}

void NodeSession::List(uint32_t request, const std::wstring &url)
{
    std::vector<BrowseEntry> entries;
    bool found = m_engine.Browse(url, entries, m_fromNode);
    Reply([&](wire::Out &out) {
        out.U32(request);
        out.U8(found ? 1 : 0);
        out.U32(static_cast<uint32_t>(entries.size()));
        for (const BrowseEntry &e : entries) {
            out.Text(e.name);
            out.U16(e.kind);
            out.U8(e.leaf ? 1 : 0);
            out.U16(e.dataType);
            out.U16(e.access);
            // Whether the member's URL as a library would build it from this
            // listing names it: the library may then subscribe to it without
            // waiting for the node's answer.
            out.U8(e.leaf && m_engine.HasMember(wire::MemberUrl(url, e.name)) ? 1 : 0);
        }
    });
}

void NodeSession::Finish()
{
    m_queue.Push(wire::Kind::Closing, [](wire::Out &) {});
    m_queue.CloseWhenWritten();
}

void NodeSession::TopologyChanged()
{
    m_queue.Push(wire::Kind::Topology, [](wire::Out &) {});
}

HRESULT STDMETHODCALLTYPE NodeSession::OnData(void *cookie, uint32_t flags, const CadroValue *value, int32_t errorFlag,
                                              uint32_t timeLow, uint32_t timeHigh)
{
    // A member's new value goes to its subscriptions one after the other:
    // they share one frame, which carries the value once.
    wire::PackedFields packed;
    if (packed.Pack(flags, *value, errorFlag, timeLow, timeHigh)) {
        m_queue.PushId(wire::Kind::Data, packed.View(), IdOf(cookie));
    } else {
        wire::Out fields;
        fields.U32(flags);
        fields.Value(*value);
        fields.U32(static_cast<uint32_t>(errorFlag));
        fields.U32(timeLow);
        fields.U32(timeHigh);
        m_queue.PushId(wire::Kind::Data, fields.View(), IdOf(cookie));
    }
    return S_OK;
}

HRESULT STDMETHODCALLTYPE NodeSession::OnAttributes(void *cookie, const CadroAttributes *attributes)
{
    m_queue.Push(wire::Kind::Attributes, [&](wire::Out &out) {
        out.U32(IdOf(cookie));
        out.U32(attributes->mask);
        out.U16(attributes->dataType);
        out.U32(attributes->access);
    });
    return S_OK;
}

HRESULT STDMETHODCALLTYPE NodeSession::StatusChange(void *cookie, uint32_t status, uint32_t, uint32_t)
{
    m_queue.Push(wire::Kind::Status, [&](wire::Out &out) {
        out.U32(IdOf(cookie));
        out.U32(status);
    });
    return S_OK;
}

} // namespace cadrosim
