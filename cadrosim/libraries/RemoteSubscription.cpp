// A subscription through the node: what its holder calls, passed to its link.
#include "NodeLinkParts.h"

#include <cstring>
#include <new>

namespace cadrosim {
using namespace link; // the link's own limits and waits

// ---- RemoteSubscription ------------------------------------------------------

RemoteSubscription *RemoteSubscription::Create(uint8_t link, const wchar_t *url, ICadroRealTimeReceiver *receiver,
                                               void *cookie)
{
    size_t length = wcslen(url);
    if (length > UINT32_MAX / 4)
        return nullptr;
    bool narrow = std::all_of(url, url + length, [](wchar_t c) { return c < 0x80; });
    void *block = operator new(sizeof(RemoteSubscription), narrow ? length : length * sizeof(wchar_t));
    return block ? ::new (block) RemoteSubscription(link, receiver, cookie, url, length, narrow) : nullptr;
}

void *RemoteSubscription::operator new(size_t size, size_t urlBytes)
{
    return ::operator new(size + urlBytes, std::nothrow);
}

void RemoteSubscription::operator delete(void *p)
{
    ::operator delete(p);
}

RemoteSubscription::RemoteSubscription(uint8_t link, ICadroRealTimeReceiver *r, void *c, const wchar_t *url,
                                       size_t length, bool narrow)
    : receiver(r), cookie(c), m_urlLength(static_cast<uint32_t>(length)), m_urlNarrow(narrow), m_link(link)
{
    char *stored = reinterpret_cast<char *>(this + 1);
    if (narrow)
        std::transform(url, url + length, stored, [](wchar_t ch) { return static_cast<char>(ch); });
    else
        memcpy(stored, url, length * sizeof(wchar_t));
    receiver->AddRef();
    Link().AddUse();
}

NodeLink &RemoteSubscription::Link() const
{
    return NodeLink::At(m_link);
}

std::wstring RemoteSubscription::Url() const
{
    const char *stored = reinterpret_cast<const char *>(this + 1);
    if (m_urlNarrow)
        return std::wstring(stored, stored + m_urlLength);
    return std::wstring(reinterpret_cast<const wchar_t *>(stored), m_urlLength);
}

RemoteSubscription::~RemoteSubscription()
{
    receiver->Release();
    Link().ReleaseUse();
}

HRESULT RemoteSubscription::Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const
{
    return feed->mirror.Recall(flags, value, errorFlag, time);
}

void RemoteSubscription::Delete()
{
    delete this;
}

HRESULT STDMETHODCALLTYPE RemoteSubscription::Write(const CadroValue *value)
{
    return Link().Write(this, value);
}

HRESULT STDMETHODCALLTYPE RemoteSubscription::Read(uint32_t *flags, CadroValue *value, int32_t *errorFlag,
                                                   FILETIME *time)
{
    return Link().Read(this, flags, value, errorFlag, time);
}

void RemoteSubscription::LastRelease()
{
    Link().Unsubscribe(this);
}

} // namespace cadrosim
