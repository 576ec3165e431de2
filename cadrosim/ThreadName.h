#pragma once
// Names the calling thread for debuggers and the system's thread list (under
// Wine, /proc/PID/task/TID/comm): a process's threads are told apart there.
// SetThreadDescription is looked up, not imported: older systems lack it.
#include <windows.h>

#include <thread>
#include <utility>

namespace cadrosim {

inline void NameThisThread(const wchar_t *name)
{
    using Describe = HRESULT(WINAPI *)(HANDLE, PCWSTR);
    static const auto describe = reinterpret_cast<Describe>(
        reinterpret_cast<void *>(GetProcAddress(GetModuleHandleW(L"kernel32.dll"), "SetThreadDescription")));
    if (describe)
        describe(GetCurrentThread(), name);
}

// A thread that names itself, then runs body.
template <class Body> std::thread NamedThread(const wchar_t *name, Body body)
{
    return std::thread([name, body = std::move(body)]() mutable {
        NameThisThread(name);
        body();
    });
}

} // namespace cadrosim
