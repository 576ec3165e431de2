#pragma once
// The member as the node last sent it, its URL, and the subscriptions that
// take its frames. Every subscription is in one: the node's subscription
// that this process's subscriptions to one URL share (the node's feed, by
// its id), or one of its own until the node says which feed it joined (id
// 0). When the node drops a feed, each member goes on with a copy of its
// own; the last member to leave a feed deletes it. The link's, under its
// lock.
//
// The URL is the feed's rather than each subscription's: a plant's items
// follow one member many times over, and it is kept only to subscribe again
// after a reconnection. It follows the feed in the same block, a byte a
// character when it is ASCII (URLs nearly always are), else two. Members
// that the node put in one feed name one member, whatever their spelling:
// they subscribe again by the feed's.
#include "MemberMirror.h"

#include <cstdint>
#include <string>

namespace cadrosim {

class LinkFeed {
public:
    // A feed of url without members; null when memory is short.
    static LinkFeed *Create(const wchar_t *url);
    // A feed of other's URL and member state, without members or id.
    static LinkFeed *CopyOf(const LinkFeed &other);
    static void operator delete(void *block) { ::operator delete(block); }
    LinkFeed(const LinkFeed &) = delete;
    LinkFeed &operator=(const LinkFeed &) = delete;

    std::wstring Url() const;
    bool Alone() const { return members <= 1; }

    uint32_t id = 0; // the node's feed; 0: not the node's

private:
    // The URL's length in characters, and whether they are stored a byte
    // each: beside the id, where the feed has room for them (a feed is 40
    // bytes before its URL).
    uint32_t m_urlLength : 31;
    uint32_t m_urlNarrow : 1;

public:
    MemberMirror mirror;
    // The members: a list through the subscriptions themselves, by their
    // ids in the link's table (RemoteSubscription::next and prev), newest
    // first. An array of them cost a plant's member whose items are in ten
    // groups a heap block for the array and one for its header, and every
    // array that it outgrew stayed behind as a hole in the heap: together
    // some 35 bytes an item, and a join that could fail for want of memory.
    uint32_t head = 0; // 0: none
    uint32_t members = 0;

private:
    LinkFeed(uint32_t urlLength, bool narrow) : m_urlLength(urlLength), m_urlNarrow(narrow) {}
    static LinkFeed *Make(size_t length, bool narrow);
    char *Stored() const { return reinterpret_cast<char *>(const_cast<LinkFeed *>(this) + 1); }
};
static_assert(sizeof(void *) != 8 || sizeof(LinkFeed) == 40, "a feed is 40 bytes before its URL");

} // namespace cadrosim
