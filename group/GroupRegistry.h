#pragma once
// A server object's index of its groups, by name and by server handle. Every
// operation takes the registry lock for its own duration only.
#include "SyncObject.h"
#include "opcda.h"

#include <map>
#include <string>
#include <utility>
#include <vector>

class COPCGroup;

class CGroupRegistry {
public:
    COPCGroup *FindName(const std::wstring &name);
    bool InsertName(const std::wstring &name, COPCGroup *group);
    // Erases the entry only when it belongs to group (null: any); returns the
    // number of entries erased.
    size_t EraseName(const std::wstring &name, COPCGroup *group = nullptr);

    COPCGroup *FindHandle(OPCHANDLE handle);
    bool InsertHandle(OPCHANDLE handle, COPCGroup *group);
    size_t EraseHandle(OPCHANDLE handle, COPCGroup *group = nullptr);

    // Snapshots in ascending order.
    std::vector<std::pair<std::wstring, COPCGroup *>> ByName();
    std::vector<OPCHANDLE> Handles();

    CCriticalSection &Lock() { return m_lock; }

private:
    CCriticalSection m_lock{LockOrder::Inner};
    std::map<std::wstring, COPCGroup *> m_byName;
    std::map<OPCHANDLE, COPCGroup *> m_byHandle;
};
