#pragma once
// The run of a COM local server process: its class object registered for as
// long as its lifetime decides (ServerLifetime.h), the main thread waiting
// for the lifetime's steps and dispatching whatever messages arrive.
#include <unknwn.h>

#include <vector>

// Every interface the process's objects give to clients (IUnknown goes
// without saying): they stay registered with the RPC runtime while the
// process serves (InterfaceAnchor.h).
using ExportedInterfaces = std::vector<const IID *>;

// Registers factory as the class object of clsid and serves until the
// lifetime decides to stop; the class object is revoked on return.
// startedByCom: the process is idle from its start. 0, or the registration's
// failure: a process whose class object cannot be registered leaves at once
// instead of idling forever.
int RunLocalServer(REFCLSID clsid, IClassFactory &factory, bool startedByCom, const ExportedInterfaces &exported);

// Uninitialises COM and returns exitCode; the uninitialisation may take at
// most a few seconds before the process is ended with exitCode.
int EndLocalServer(int exitCode);

// The whole run of a local server executable, from its WinMain: COM in the
// multithreaded apartment; "RegServer" and "UnregServer" run the given
// switch (its result is the exit code); anything else serves clsid through
// factory, whose objects export the interfaces exported. Returns the exit
// code.
int LocalServerMain(REFCLSID clsid, IClassFactory &factory, const ExportedInterfaces &exported, int (*registerServer)(),
                    int (*unregisterServer)());
