#pragma once
// The order of the server's locks, outermost first. A thread that holds a
// lock may take only a lock of a later level, or one that it holds already
// (they are recursive). Locks of one level are never held together.
//
//   1 Services       the process-wide services (first and last server object)
//   2 Server         a server object: AddGroup, GetStatus and the registry
//                    changes of RemoveGroup; never held while a removal waits
//   3 Group          a group: its state, items and I/O passes; never held
//                    while a client is called
//   4 Registry       a server's group registry (SetName under the group lock),
//     Scanner        the update scanner's queue (SetActive under the group lock),
//     Transactions   the transaction queue,
//     Connections    a list of DA 1.0 advise connections,
//     SinkSlot       a connection point's one sink
//   5 Activity       a group's calls, callbacks and work in flight
//   6 Leaf           locks under which no other lock of the server is taken
//                    (identifiers, the server's last update time, the
//                    callbacks in flight, the process's lifetime)
//
// The locks of the item side (items, the real-time client, the address
// space) are taken under a group lock and take none of these.
//
// Debug builds check the order whenever a lock with a level is taken and
// report a violation as an internal assertion failure.
namespace LockOrder {
enum Level : int { Unchecked = 0, Services = 1, Server = 2, Group = 3, Inner = 4, Activity = 5, Leaf = 6 };

// The checks behind CCriticalSection (for every build's tests): a lock of
// level is being taken (false: the order is broken), or has been released.
bool Acquire(const void *lock, Level level);
void Release(const void *lock);
} // namespace LockOrder
