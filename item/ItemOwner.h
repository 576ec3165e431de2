#pragma once
// What an item needs of the group that owns it.
#include "SyncObject.h"

#include <list>

class COPCItem;
using ActiveItemList = std::list<COPCItem *>;

class CItemOwner {
public:
    // The group lock; the item takes it inside its own lock only to change
    // the active-item list.
    virtual CSyncObject &GroupLock() = 0;
    virtual ActiveItemList &ActiveItems() = 0;
    // Read without the group lock (a plain flag).
    virtual bool GroupActive() const = 0;

protected:
    ~CItemOwner() = default;
};
