#pragma once
// What a group needs of the server object that owns it.
#include "GroupRegistry.h"
#include "opcda.h"

class CGroupOwner {
public:
    virtual IOPCServer *OwnerServer() = 0;
    virtual CGroupRegistry &Registry() = 0;
    // A call from a group into its server (CloneGroup) keeps the server from
    // completing its final release until LeaveGroupCall; false when the
    // server is already being released.
    virtual bool EnterGroupCall() = 0;
    virtual void LeaveGroupCall() = 0;
    // A scan delivered a data change to a client.
    virtual void SetLastUpdateTime(const FILETIME &time) = 0;

protected:
    ~CGroupOwner() = default;
};
