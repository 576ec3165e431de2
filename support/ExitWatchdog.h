#pragma once
// Bounds the last stretch of a process's exit. Once the server has decided to
// leave, the platform's uninitialisation may still block (Wine's
// CoUninitialize has been seen to wait forever for RPC calls that no thread
// runs); the watchdog then ends the process when the bound has passed. The
// class object is revoked before it is armed, so that no client is handed a
// process that is about to vanish.
#include "Handle.h"

#include <windows.h>

class CExitWatchdog {
public:
    using Expiry = void (*)(void *context);
    // Calls expire(context) on a thread of its own unless it is disarmed
    // (destroyed) within boundMs.
    CExitWatchdog(DWORD boundMs, Expiry expire, void *context);
    // Ends the process with exitCode.
    CExitWatchdog(DWORD boundMs, UINT exitCode);
    ~CExitWatchdog();
    CExitWatchdog(const CExitWatchdog &) = delete;
    CExitWatchdog &operator=(const CExitWatchdog &) = delete;

private:
    static DWORD WINAPI Run(void *self);
    static void Terminate(void *exitCode);

    DWORD m_boundMs;
    Expiry m_expire;
    void *m_context;
    UniqueHandle m_disarm;
    UniqueHandle m_thread;
};
