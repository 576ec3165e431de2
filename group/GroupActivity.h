#pragma once
// What a group's removal waits for, and what it must not wait for.
//
// A removal waits until the group's work has let go of it: client calls in
// flight on the group, and scans and transactions running (queued ones are
// taken off their queues first). It must never wait for something that may
// be waiting for it, or a client could freeze the server:
//   - a call or callback of the remover's own logical thread (a client that
//     removes the group from inside the group's own callback, or from a sink
//     called inside its own DAdvise);
//   - any client callback at all when the remover itself runs inside a client
//     callback of this process: two callbacks that each remove the other's
//     group would otherwise wait for each other for ever.
// A scan or transaction that the removal did not wait for finds the group
// removed when its callback returns, and lets go of it then.
//
// Logical threads: a call that a client makes from inside a callback carries
// the callback's logical thread (COM's causality id), also when it arrives
// on another physical thread.
#include "SyncObject.h"

#include <windows.h>

#include <vector>

struct LogicalCaller {
    GUID logicalThread;
    DWORD thread;
    bool operator==(const LogicalCaller &o) const;
    static LogicalCaller Current();
};

// The logical threads that are inside a client callback of this process.
namespace CallbacksInFlight {
void Enter(const LogicalCaller &caller);
void Leave(const LogicalCaller &caller);
bool Inside(const LogicalCaller &caller);
} // namespace CallbacksInFlight

// One group's bookkeeping, under a lock of its own: a client's call enters
// without waiting for the group lock, which a device read may hold for
// seconds (a Cancel2 must reach the queue before the worker does).
// Lock order: the group lock, then this one; CallbacksInFlight's innermost.
class CGroupActivity {
public:
    enum class Kind {
        Call,         // a client's call on the group
        WorkCallback, // a scan or transaction inside a client callback
        CallCallback, // a call inside a client callback (DAdvise's refresh)
    };
    // A client's call: false once removal has begun.
    bool EnterCall(const LogicalCaller &caller);
    void LeaveCall(const LogicalCaller &caller);
    // A client callback from caller's thread; returns the kind to end it with.
    Kind BeginCallback(const LogicalCaller &caller);
    void EndCallback(const LogicalCaller &caller, Kind kind);

    // Scanner entries and transactions. ReleaseWork says whether a removal
    // is waiting, which then takes over the unit's group reference.
    void AddWork();
    bool ReleaseWork();

    bool Removing();
    // Sets the removing flag: every later EnterCall fails.
    void MarkRemoving();
    // Waits, holding no other lock, until nothing that remover may wait for
    // is left; returns the group references handed over meanwhile.
    LONG WaitForRemoval(const LogicalCaller &remover);

private:
    struct Entry {
        LogicalCaller caller;
        Kind kind;
    };
    LONG Blocking(const LogicalCaller &remover) const;
    void Remove(const LogicalCaller &caller, Kind kind);
    void Changed();

    CCriticalSection m_lock{LockOrder::Activity};
    CONDITION_VARIABLE m_changed = CONDITION_VARIABLE_INIT;
    bool m_removing = false;
    LONG m_work = 0;
    LONG m_removalsWaiting = 0;
    LONG m_handedOver = 0;
    std::vector<Entry> m_entries;
};
