#pragma once
// The module lock count: every live COM object of the server and every
// outstanding LockServer(TRUE) holds one. When it falls to 0 the class objects
// are suspended and the main thread is told to quit.
#include <windows.h>

namespace ComModule {
void Lock();
void Unlock();
LONG LockCount();
// The thread whose message loop ends the process; 0 (the default, as in test
// programs) means nobody is told to quit.
void SetMainThreadId(DWORD id);
} // namespace ComModule
