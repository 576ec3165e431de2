#pragma once
// Where a process's network is: the engine in the process itself (the
// network node, and tests that want a network of their own), or the
// machine's node, reached over its pipe (what a server process uses). The
// libraries' objects reach either through this.
#include "CadroNetwork.h"
#include "Network.h"

#include <string>
#include <vector>

namespace cadrosim {

class Backend {
public:
    // Library objects keep the backend's threads (and the node's link) up.
    virtual void AddUse() = 0;
    virtual void ReleaseUse() = 0;

    virtual HRESULT Subscribe(const wchar_t *url, void *cookie, ICadroRealTimeReceiver *receiver,
                              CadroDataItem **out) = 0;
    // The children of a URL; false when it is unknown.
    virtual bool Browse(const std::wstring &url, std::vector<BrowseEntry> &out) = 0;
    virtual void AddBrowserReceiver(ICadroBrowserReceiver *receiver) = 0;
    virtual void RemoveBrowserReceiver(ICadroBrowserReceiver *receiver) = 0;

    // A control command, whose answer's first line is "ok" or "error: ...";
    // a new network description. Callers need not hold a use.
    virtual std::wstring Execute(const std::wstring &command) = 0;
    virtual bool Load(const std::wstring &description, std::wstring &error) = 0;

protected:
    ~Backend() = default;
};

} // namespace cadrosim
