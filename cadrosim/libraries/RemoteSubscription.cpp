// A subscription through the node: what its holder calls, passed to its link.
#include "NodeLinkParts.h"

namespace cadrosim {
using namespace link; // the link's own limits and waits

// ---- RemoteSubscription ------------------------------------------------------

thread_local RemoteSubscription::Calling *RemoteSubscription::Calling::t_innermost = nullptr;

unsigned RemoteSubscription::Calling::OnThisThread(const RemoteSubscription *sub)
{
    unsigned count = 0;
    for (const Calling *c = t_innermost; c; c = c->m_outer)
        count += c->m_sub == sub;
    return count;
}

NodeLink &RemoteSubscription::Link() const
{
    return NodeLink::At(m_link);
}

HRESULT RemoteSubscription::Recall(uint32_t *flags, CadroValue *value, int32_t *errorFlag, FILETIME *time) const
{
    return feed->mirror.Recall(flags, value, errorFlag, time);
}

void RemoteSubscription::Delete()
{
    Link().Destroy(this);
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
