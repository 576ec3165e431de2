// A subscription through the node: what its holder calls, passed to its link.
#include "NodeLinkParts.h"

#include <new>

namespace cadrosim {
using namespace link; // the link's own limits and waits

// ---- RemoteSubscription ------------------------------------------------------

RemoteSubscription *RemoteSubscription::Create(uint8_t link, ICadroRealTimeReceiver *receiver, void *cookie)
{
    return new (std::nothrow) RemoteSubscription(link, receiver, cookie);
}

RemoteSubscription::RemoteSubscription(uint8_t link, ICadroRealTimeReceiver *r, void *c)
    : receiver(r), cookie(c), m_link(link)
{
    receiver->AddRef();
    Link().AddUse();
}

NodeLink &RemoteSubscription::Link() const
{
    return NodeLink::At(m_link);
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
