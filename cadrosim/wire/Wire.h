#pragma once
// The frames that a server process's libraries and the network node exchange
// over the node's pipe: a 32-bit length, a kind byte and the kind's fields,
// little-endian. Readers check every length against what arrived, so a
// truncated or garbled frame is refused, never read past.
#include "CadroNetwork.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <cwctype>
#include <string>
#include <string_view>

namespace cadrosim::wire {

enum class Kind : uint8_t {
    // Library → node.
    Subscribe = 1, // id, flags (bit 0: answer with a Reply), url
    Unsubscribe,   // id
    Write,         // id, value
    List,          // request, url
    Execute,       // request, command
    Load,          // request, description
    Catalogue,     // request: CatalogueHash of every member this node serves
    // The first frame on a node's pipe, and nothing after it until the
    // answer: the rest of the connection through shared rings (RingChannel).
    UseRings,
    // Node → library.
    Reply = 64, // request, then what the request asked for
    Data,       // flags, value, error flag, time low, time high, then ids to the end
    Attributes, // id, data type, access
    Status,     // id, status
    Topology,   // the network's topology changed
    Closing,    // the node is shutting down on request: not to be restarted
    // A library's subscriptions to one URL share one subscription on the
    // node, a feed: a subscription joins its feed once it has been told
    // what a new one is told first (its own frames above), and from then
    // on takes the feed's frames.
    Joined,         // id, feed
    FeedData,       // as Data, with feeds for ids
    FeedAttributes, // feed, data type, access
    FeedStatus,     // feed, status
    // The answer to UseRings, the last frame on the pipe: the rings' name,
    // or an empty one when the connection stays on the pipe.
    Rings,
};

// A feed's id: its slot on the node plus one, in the low bits, under a
// generation that tells it from an earlier feed of the slot.
constexpr uint32_t kFeedSlotBits = 20;
constexpr uint32_t kFeedSlotMask = (1u << kFeedSlotBits) - 1;
// The slot of a feed's id: UINT32_MAX for an id without one, which no table
// reaches.
constexpr uint32_t FeedSlot(uint32_t feedId)
{
    return (feedId & kFeedSlotMask) - 1;
}

// A subscription's id: its slot in the library's table plus one, in the low
// bits, under a generation that tells it from an earlier subscription of the
// slot. A library has one subscription a slot: the node keeps them by slot,
// and a new id in a slot ends the subscription that had it.
constexpr uint32_t kSubscriptionSlotBits = 22;
constexpr uint32_t kSubscriptionSlotMask = (1u << kSubscriptionSlotBits) - 1;
// The slot of a subscription's id: UINT32_MAX for an id without one.
constexpr uint32_t SubscriptionSlot(uint32_t id)
{
    return (id & kSubscriptionSlotMask) - 1;
}

// The machine's node: its pipe, which every server's libraries reach.
constexpr const wchar_t *kNodeName = L"CadroNode";
inline std::wstring PipeNameOf(const std::wstring &nodeName)
{
    return L"\\\\.\\pipe\\" + nodeName;
}
inline const wchar_t *NodePipeName()
{
    static const std::wstring name = PipeNameOf(kNodeName);
    return name.c_str();
}

// A URL's hash (FNV-1a over its characters), for the tables of URLs; from
// h, the hash of the text before url.
inline uint64_t UrlHash(std::wstring_view url, uint64_t h = 1469598103934665603ull)
{
    for (wchar_t c : url) {
        h ^= static_cast<uint16_t>(c);
        h *= 1099511628211ull;
    }
    return h;
}

// A second hash of a URL, independent of UrlHash: a table that keeps both
// instead of the URL tells URLs apart but for one chance in 2^128.
inline uint64_t UrlCheck(std::wstring_view url)
{
    uint64_t h = 0x2545f4914f6cdd1dull ^ url.size();
    for (wchar_t c : url) {
        h = (h ^ static_cast<uint16_t>(c)) * 0x9e3779b97f4a7c15ull;
        h ^= h >> 29;
    }
    return h;
}

// A member URL's hash for the node's catalogue: as UrlHash, with the
// machine's name (which URLs may spell in any case) in lower case. The node
// hashes each member's plain spelling ("\\machine\process\object.part", and "."
// for its own host); a URL that spells it otherwise is not found there
// and is looked up by the node.
inline uint64_t CatalogueHash(std::wstring_view url)
{
    if (url.size() < 2 || url[0] != L'\\' || url[1] != L'\\')
        return UrlHash(url);
    size_t machineEnd = std::min(url.find(L'\\', 2), url.size());
    uint64_t h = UrlHash(url.substr(0, 2));
    for (size_t i = 2; i < machineEnd; ++i) {
        h ^= static_cast<uint16_t>(towlower(url[i]));
        h *= 1099511628211ull;
    }
    return UrlHash(url.substr(machineEnd), h);
}

// The URL of a member listed under url: its part (the name up to the first
// "-") after the member separator; "(implicit)" is named by url itself.
inline std::wstring MemberUrl(const std::wstring &url, const std::wstring &name)
{
    if (name == L"(implicit)")
        return url;
    return url + L"." + name.substr(0, name.find(L'-'));
}

// UrlHash(MemberUrl(url, name)) without building the URL, from urlHash, the
// hash of url.
inline uint64_t MemberUrlHash(uint64_t urlHash, const std::wstring &name)
{
    if (name == L"(implicit)")
        return urlHash;
    return UrlHash(std::wstring_view(name).substr(0, name.find(L'-')), UrlHash(L".", urlHash));
}

class Out {
public:
    // Starts a frame; End() writes its length.
    void Begin(Kind kind);
    void End();
    void U8(uint8_t v) { Raw(&v, 1); }
    void U16(uint16_t v) { Raw(&v, 2); }
    void U32(uint32_t v) { Raw(&v, 4); }
    void U64(uint64_t v) { Raw(&v, 8); }
    void F64(double v) { Raw(&v, 8); }
    void Text(std::wstring_view text);
    void Value(const CadroValue &value);
    // Mask, data type and access.
    void Attributes(const CadroAttributes &a)
    {
        U32(a.mask);
        U16(a.dataType);
        U32(a.access);
    }
    void Raw(const void *p, size_t n) { m_bytes.append(static_cast<const char *>(p), n); }

    // Adds id to the last frame when it is a frame of kind that starts with
    // fields (a frame of ids that share them); false when it is not.
    bool ExtendLast(Kind kind, std::string_view fields, uint32_t id);
    // A whole frame of fields and one id, written in one step: a node
    // writes a million a second, and each append of a few bytes would be a
    // call of the runtime's memmove.
    void Frame(Kind kind, std::string_view fields, uint32_t id);

    size_t Size() const { return m_bytes.size(); }
    std::string_view View() const { return m_bytes; }
    bool Empty() const { return m_bytes.empty(); }
    void Clear();
    // Hands the bytes over, leaving this empty.
    void Take(std::string &into);

private:
    std::string m_bytes;
    size_t m_frameStart = SIZE_MAX; // of the last frame begun, while it is here
};

// A Data frame's fields (flags, value, error flag, time) for a value that
// is not a text: the bytes Out writes, packed on the stack.
class PackedFields {
public:
    // The most a value's packed fields take: flags, type, a number, the
    // error flag and the time's two halves.
    static constexpr size_t kMostBytes = 4 + 4 + sizeof(double) + 4 + 4 + 4;
    // False for a text value, which Out must write.
    bool Pack(uint32_t flags, const CadroValue &value, int32_t error, uint32_t low, uint32_t high)
    {
        if (value.type & kCadroTextBit)
            return false;
        m_size = 0;
        Put(flags);
        Put(value.type);
        if (value.type == kCadroBoolean)
            Put(static_cast<uint8_t>(value.boolean));
        else
            Put(value.number);
        Put(static_cast<uint32_t>(error));
        Put(low);
        Put(high);
        return true;
    }
    std::string_view View() const { return {m_bytes, m_size}; }

private:
    template <class T> void Put(T v)
    {
        memcpy(m_bytes + m_size, &v, sizeof v);
        m_size += sizeof v;
    }
    char m_bytes[kMostBytes];
    size_t m_size = 0;
};

class In {
public:
    In(const char *p, size_t n) : m_p(p), m_end(p + n) {}
    uint8_t U8() { return Get<uint8_t>(); }
    uint16_t U16() { return Get<uint16_t>(); }
    uint32_t U32() { return Get<uint32_t>(); }
    uint64_t U64() { return Get<uint64_t>(); }
    double F64() { return Get<double>(); }
    std::wstring Text();
    // A text value gets a new text object, which the caller clears.
    void Value(CadroValue &value);
    CadroAttributes Attributes()
    {
        CadroAttributes a = {};
        a.mask = U32();
        a.dataType = U16();
        a.access = U32();
        return a;
    }
    bool Ok() const { return m_ok; }
    bool AtEnd() const { return m_p == m_end; }
    // What is left of the frame.
    std::string Rest() const { return std::string(m_p, m_end); }

private:
    template <class T> T Get()
    {
        T v{};
        if (static_cast<size_t>(m_end - m_p) < sizeof v) {
            m_ok = false;
            m_p = m_end;
            return v;
        }
        memcpy(&v, m_p, sizeof v);
        m_p += sizeof v;
        return v;
    }
    const char *m_p;
    const char *m_end;
    bool m_ok = true;
};

// A reading buffer larger than this (grown by a frame larger than a read)
// is given back once it is empty.
inline constexpr size_t kKeptBufferBytes = 1u << 20;

// Splits whole frames off the front of buffer: calls handle(kind, fields)
// for each and keeps an incomplete one for the next read. False when a frame
// is impossible (a length too large): the peer speaks something else.
template <class Handle> bool TakeFrames(std::string &buffer, Handle handle)
{
    constexpr uint32_t kLargestFrame = 1u << 30;
    size_t consumed = 0;
    while (buffer.size() - consumed >= 5) {
        uint32_t length;
        memcpy(&length, buffer.data() + consumed, 4);
        if (length == 0 || length > kLargestFrame)
            return false;
        if (buffer.size() - consumed - 4 < length)
            break;
        const char *frame = buffer.data() + consumed + 4;
        consumed += 4 + length;
        handle(static_cast<Kind>(frame[0]), In(frame + 1, length - 1));
    }
    // What is left is one frame's beginning: it moves to the front at once
    // (a few bytes, or once the start of a large frame), so that the buffer
    // holds no more than that and one read. Only a large frame grows it
    // beyond the bound, and then it goes once the frame has been taken.
    if (consumed == buffer.size() && buffer.capacity() > kKeptBufferBytes)
        std::string().swap(buffer);
    else
        buffer.erase(0, consumed);
    return true;
}

} // namespace cadrosim::wire
