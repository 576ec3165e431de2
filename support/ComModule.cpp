#include "ComModule.h"

#include "ServerLifetime.h"

#include <atomic>

namespace {
std::atomic<LONG> g_lockCount{0};
std::atomic<CServerLifetime *> g_lifetime{nullptr};
} // namespace

void ComModule::Lock()
{
    ++g_lockCount;
    if (CServerLifetime *lifetime = g_lifetime.load())
        lifetime->Lock();
}

bool ComModule::TryLock()
{
    CServerLifetime *lifetime = g_lifetime.load();
    if (lifetime && !lifetime->TryLock())
        return false;
    ++g_lockCount;
    return true;
}

void ComModule::Unlock()
{
    --g_lockCount;
    if (CServerLifetime *lifetime = g_lifetime.load())
        lifetime->Unlock();
}

LONG ComModule::LockCount()
{
    return g_lockCount.load();
}

void ComModule::SetLifetime(CServerLifetime *lifetime)
{
    g_lifetime.store(lifetime);
}
