#pragma once
// The server's picture of the Cadro network: configured roots (registry
// value "Cadro Root URLs"), under them the processes, objects and members the
// network reports. Children are read from the network again on every descent
// and merged into the tree. Built once per process and kept until it ends.
//
// One recursive lock guards the whole tree and the network browse session
// (which is stateful: Open, then Next); nodes are shared, so a node that a
// refresh drops stays valid, detached, for whoever still holds it.
#include "AddrNode.h"
#include "CadroNetwork.h"
#include "SyncObject.h"

#include <functional>

class CAddrSpace {
public:
    static CAddrSpace *Create();
    // Reads (and on first use writes) the root URLs from the registry.
    HRESULT Build();

    DWORD Organization() const { return 1; } // OPC_NS_HIERARCHIAL
    AddrNodePtr Root() const { return m_root; }
    CSyncObject &Lock() { return m_lock; }

    // Reads a branch's children from the network and merges them in; the
    // root and leaves are left as they are. OPC_E_UNKNOWNITEMID when the
    // network refuses the browse. Within one client call (a CCallPass) a
    // node is read once: later refreshes in that call give the first one's
    // result.
    HRESULT Refresh(const AddrNodePtr &node);
    // The node an item identifier names, descending (and refreshing) from
    // the root; null when none.
    AddrNodePtr FindByItemId(std::wstring_view itemId);
    // Reads ahead the branches that lookups of these identifiers will read
    // in this call's pass, several at once: level by level, each round reads
    // together every branch that some lookup would read next, so that a call
    // naming items of a hundred objects waits for one round trip to the
    // network rather than a hundred. The lookups then find them read; each
    // branch is still read once in the pass, and the same ones are read as
    // the lookups alone would. Nothing without a pass or a parallel source.
    void ReadAhead(const std::vector<std::wstring_view> &itemIds);
    // The direct child whose display name (or part, without one) equals name
    // exactly; no refresh.
    AddrNodePtr FindChild(const AddrNodePtr &node, const std::wstring &name);

    // A node from one browse record of the network, and just the
    // identifier part such a node would have (a view into the record).
    static AddrNodePtr MakeNode(const BrowseRecord &record);
    static std::wstring_view IdPartOf(const BrowseRecord &record);
    // Adds root children from "name=URL,name=URL" text.
    void AddRoots(const std::string &text);

    // How the tree reaches the network: Open(url) then Next(mask, record)
    // until a negative result. Installed by the server's services.
    // The functions hold no more than a pointer or two: a refresh that
    // finds nothing changed allocates nothing.
    struct Browser {
        std::function<HRESULT(const wchar_t *url)> open;
        std::function<HRESULT(BrowseRecord *record)> next;
        std::function<void()> release; // lets go of the session after use
        Browser() = default;
        Browser(const Browser &) = delete;
        Browser &operator=(const Browser &) = delete;
        ~Browser()
        {
            if (release)
                release();
        }
    };
    using BrowserSource = std::function<bool(Browser &browser)>;
    // parallel, when given, hands out browsers of sessions of their own,
    // which threads may use side by side (for ReadAhead).
    void SetBrowserSource(BrowserSource source, BrowserSource parallel = nullptr);

private:
    CAddrSpace();
    AddrNodePtr FindFrom(const AddrNodePtr &node, std::wstring_view text);
    // The children of node that the next step of a lookup of text can take,
    // in list order.
    struct Steps;
    // The child whose part equals part without regard to case (at most
    // one: a refresh keeps one of names that differ only in case); null
    // when none. Found through the branch's index when it has one.
    static const AddrNodePtr *FindPart(const CAddrNode &node, std::wstring_view part);
    // Rebuilds the index of a branch's children (none for a handful of
    // them: a search of a short list is as quick).
    static void IndexChildren(CAddrNode &node);
    void Candidates(CAddrNode &node, std::wstring_view text, Steps &out);
    HRESULT ReadChildren(const AddrNodePtr &node);
    // Merges the records that next(record) gives until it fails (each
    // record's texts freed) into the branch's children.
    void MergeRecords(const AddrNodePtr &node, const std::function<HRESULT(BrowseRecord *record)> &next);
    // What a lookup of text from node would do next in pass: find its node,
    // fail, or read a branch first (Read: that branch, in toRead).
    enum class Ahead { Found, Missing, Read };
    Ahead NextRead(const AddrNodePtr &node, std::wstring_view text, uint64_t pass, AddrNodePtr &toRead);
    // One round of ReadAhead: false when no lookup has a branch left to read.
    bool ReadAheadRound(const std::vector<std::wstring_view> &itemIds, uint64_t pass);
    void Merge(const AddrNodePtr &node, std::vector<AddrNodePtr> &fresh);
    void AddRoot(const std::wstring &name, const std::wstring &url);

    CCriticalSection m_lock;
    AddrNodePtr m_root;
    BrowserSource m_browserSource;
    BrowserSource m_parallelSource;
    std::wstring m_url;      // a refresh's browse URL, kept for its capacity
    uint64_t m_lastMark = 0; // marks of refreshes on the children they saw
};
