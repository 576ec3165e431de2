#pragma once
// How the server lets go of a client's sink (a data callback, an advise sink,
// a shutdown sink).
//
// Under Wine a client process can hang for ever when its last exported
// object of an interface is released (the server's RemRelease) while a call
// on that interface is just ending on another of its threads: the runtime's
// RpcServerUnregisterIf reads the interface's call count before the ending
// call lowers it, the ending call looks for a waiter before one is in place,
// and nobody wakes the waiter, which holds the lock that the client's every
// later marshalling needs. The server lets go of a sink right after a
// callback to it returns more often than not (a group removed during the
// callback, a scan's own reference to a sink unadvised meanwhile), so a
// sink in another process is released by a thread of its own a second
// later, when every call on it has long ended in the client. A sink in this
// process is released at once.
#include <unknwn.h>

#include <utility>

namespace SinkRelease {
// Whether sink is a proxy (the proxy manager answers IMultiQI itself).
bool IsRemote(IUnknown *sink);
// Takes over one reference to sink and releases it: now, or a second later
// when it is remote.
void Release(IUnknown *sink, bool remote);
// Releases every sink still waiting, now (the process is leaving).
void Flush();
} // namespace SinkRelease

// One reference to a client's sink, released as SinkRelease says.
template <class T> class CSinkRef {
public:
    CSinkRef() = default;
    CSinkRef(std::nullptr_t) {}
    // Takes over a reference the caller owns.
    static CSinkRef Attach(T *p, bool remote)
    {
        CSinkRef r;
        r.m_p = p;
        r.m_remote = remote;
        return r;
    }
    CSinkRef(const CSinkRef &o) : m_p(o.m_p), m_remote(o.m_remote)
    {
        if (m_p)
            m_p->AddRef();
    }
    CSinkRef(CSinkRef &&o) noexcept : m_p(std::exchange(o.m_p, nullptr)), m_remote(o.m_remote) {}
    ~CSinkRef() { Reset(); }
    CSinkRef &operator=(CSinkRef o) noexcept
    {
        std::swap(m_p, o.m_p);
        std::swap(m_remote, o.m_remote);
        return *this;
    }
    void Reset()
    {
        if (m_p)
            SinkRelease::Release(std::exchange(m_p, nullptr), m_remote);
    }
    T *Detach() { return std::exchange(m_p, nullptr); }
    // The same sink through an interface it was queried for, with a
    // reference of its own.
    template <class I> CSinkRef<I> As() const
    {
        if (m_p)
            m_p->AddRef();
        return CSinkRef<I>::Attach(static_cast<I *>(m_p), m_remote);
    }

    T *Get() const { return m_p; }
    T *operator->() const { return m_p; }
    explicit operator bool() const { return m_p != nullptr; }

private:
    T *m_p = nullptr;
    bool m_remote = false;
};
