#pragma once
// The module lock count: every live COM object of the server and every
// outstanding LockServer(TRUE) holds one. In the server process the count
// belongs to its CServerLifetime, which decides when the process leaves;
// without one (test programs) it is only counted.
#include <windows.h>

class CServerLifetime;

namespace ComModule {
void Lock();
void Unlock();
// A creation or LockServer(TRUE): false once the process has decided to
// exit (the caller answers CO_E_SERVER_STOPPING).
bool TryLock();
LONG LockCount();
// The lifetime that holds the count, set once before any object exists.
void SetLifetime(CServerLifetime *lifetime);
} // namespace ComModule
