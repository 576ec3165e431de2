// A feed's block: the feed and its URL.
#include "LinkFeed.h"

#include <algorithm>
#include <cstring>
#include <cwchar>
#include <new>

namespace cadrosim {

LinkFeed *LinkFeed::Make(size_t length, bool narrow)
{
    if (length > INT32_MAX / sizeof(wchar_t))
        return nullptr;
    void *block = ::operator new(sizeof(LinkFeed) + (narrow ? length : length * sizeof(wchar_t)), std::nothrow);
    return block ? ::new (block) LinkFeed(static_cast<uint32_t>(length), narrow) : nullptr;
}

LinkFeed *LinkFeed::Create(const wchar_t *url)
{
    size_t length = wcslen(url);
    bool narrow = std::all_of(url, url + length, [](wchar_t c) { return c < 0x80; });
    LinkFeed *feed = Make(length, narrow);
    if (!feed)
        return nullptr;
    if (narrow)
        std::transform(url, url + length, feed->Stored(), [](wchar_t ch) { return static_cast<char>(ch); });
    else
        memcpy(feed->Stored(), url, length * sizeof(wchar_t));
    return feed;
}

LinkFeed *LinkFeed::CopyOf(const LinkFeed &other)
{
    LinkFeed *feed = Make(other.m_urlLength, other.m_urlNarrow);
    if (!feed)
        return nullptr;
    memcpy(feed->Stored(), other.Stored(), other.m_urlNarrow ? other.m_urlLength : other.m_urlLength * sizeof(wchar_t));
    feed->mirror.CopyFrom(other.mirror);
    return feed;
}

std::wstring LinkFeed::Url() const
{
    if (m_urlNarrow)
        return std::wstring(Stored(), Stored() + m_urlLength);
    return std::wstring(reinterpret_cast<const wchar_t *>(Stored()), m_urlLength);
}

} // namespace cadrosim
