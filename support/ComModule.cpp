#include "ComModule.h"

#include "ServerLifetime.h"

#include <atomic>

namespace {
std::atomic<LONG> g_lockCount{0};
std::atomic<CServerLifetime *> g_lifetime{nullptr};
} // namespace

// The count is the lifetime's when the process has one; only programs
// without one (tests) count here.
void ComModule::Lock()
{
    if (CServerLifetime *lifetime = g_lifetime.load())
        lifetime->Lock();
    else
        ++g_lockCount;
}

bool ComModule::TryLock()
{
    if (CServerLifetime *lifetime = g_lifetime.load())
        return lifetime->TryLock();
    ++g_lockCount;
    return true;
}

void ComModule::Unlock()
{
    if (CServerLifetime *lifetime = g_lifetime.load())
        lifetime->Unlock();
    else
        --g_lockCount;
}

LONG ComModule::LockCount()
{
    CServerLifetime *lifetime = g_lifetime.load();
    return lifetime ? lifetime->Count() : g_lockCount.load();
}

void ComModule::SetLifetime(CServerLifetime *lifetime)
{
    g_lifetime.store(lifetime);
}
