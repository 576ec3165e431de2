#include "ComModule.h"

#include <objbase.h>

namespace {
volatile LONG g_lockCount = 0;
volatile DWORD g_mainThreadId = 0;
} // namespace

void ComModule::Lock()
{
    InterlockedIncrement(&g_lockCount);
}

void ComModule::Unlock()
{
    if (InterlockedDecrement(&g_lockCount) != 0)
        return;
    // No delay: the runtime hands out no new objects once suspended.
    if (CoSuspendClassObjects() == S_OK && g_mainThreadId != 0)
        PostThreadMessageA(g_mainThreadId, WM_QUIT, 0, 0);
}

LONG ComModule::LockCount()
{
    return g_lockCount;
}

void ComModule::SetMainThreadId(DWORD id)
{
    g_mainThreadId = id;
}
