#include "ExitWatchdog.h"

#include "Trace.h"

#include <cstdint>

CExitWatchdog::CExitWatchdog(DWORD boundMs, Expiry expire, void *context)
    : m_boundMs(boundMs), m_expire(expire), m_context(context), m_disarm(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    if (m_disarm)
        m_thread.Reset(CreateThread(nullptr, 0, Run, this, 0, nullptr));
    if (!m_thread)
        INTERNAL_ASSERT_FAILED("the exit watchdog's thread");
}

CExitWatchdog::CExitWatchdog(DWORD boundMs, UINT exitCode)
    : CExitWatchdog(boundMs, &Terminate, reinterpret_cast<void *>(static_cast<uintptr_t>(exitCode)))
{
}

CExitWatchdog::~CExitWatchdog()
{
    if (!m_thread)
        return;
    SetEvent(m_disarm.Get());
    WaitForSingleObject(m_thread.Get(), INFINITE);
}

DWORD WINAPI CExitWatchdog::Run(void *self)
{
    auto *watchdog = static_cast<CExitWatchdog *>(self);
    if (WaitForSingleObject(watchdog->m_disarm.Get(), watchdog->m_boundMs) == WAIT_TIMEOUT)
        watchdog->m_expire(watchdog->m_context);
    return 0;
}

void CExitWatchdog::Terminate(void *exitCode)
{
    Trace("exit took too long: the process is ended\n");
    TerminateProcess(GetCurrentProcess(), static_cast<UINT>(reinterpret_cast<uintptr_t>(exitCode)));
}
