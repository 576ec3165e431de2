#pragma once
// What an item needs of a group, without a group: tests of items and of the
// group's item table.
#include "ItemOwner.h"

class FakeGroup : public CItemOwner {
public:
    CSyncObject &GroupLock() override { return lock; }
    CActiveItemList &ActiveItems() override { return active; }
    bool GroupActive() const override { return groupActive; }
    CCriticalSection lock;
    CActiveItemList active;
    bool groupActive = true;
};
