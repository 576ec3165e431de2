#pragma once
// What an item needs of the group that owns it.
#include "ActiveItemList.h"
#include "SyncObject.h"

class CItemOwner {
public:
    // The group lock; the item takes it inside its own lock only to change
    // the active-item list.
    virtual CSyncObject &GroupLock() = 0;
    virtual CActiveItemList &ActiveItems() = 0;
    // Read without the group lock (a plain flag).
    virtual bool GroupActive() const = 0;

protected:
    ~CItemOwner() = default;
};
