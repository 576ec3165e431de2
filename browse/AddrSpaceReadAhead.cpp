// Reading ahead, several branches at once, what the lookups of one call will
// read: a client that adds the items of a hundred objects in one call would
// otherwise wait for a hundred round trips to the network, one after the
// other.
#include "AddrSpace.h"

#include "CallPass.h"
#include "OpcErrors.h"

#include <atomic>
#include <unordered_set>

namespace {
// Sessions read side by side at most; the network answers them in turn, so
// more would only add threads, and under Wine each thread that the pool
// adds holds about a megabyte of working set for seconds after the call.
// Eight readers read 100 objects no sooner than four did, and cost 4 MB more.
constexpr size_t kMostReaders = 4;
// Levels read ahead at most (machine, process, objects nested a few deep);
// anything deeper the lookups read themselves.
constexpr int kMostRounds = 8;

// One branch to read: its URL, then what the network gave.
struct Fetch {
    AddrNodePtr node;
    std::wstring url;
    std::vector<BrowseRecord> records;
    HRESULT result = S_OK;
    bool done = false; // read (or refused); otherwise left to the lookups
    Fetch() = default;
    Fetch(Fetch &&) = default;
    ~Fetch()
    {
        for (BrowseRecord &r : records) {
            SysFreeString(r.name);
            SysFreeString(r.description);
        }
    }
};

// Marks the fetch done only once its listing is whole (or refused).
void ReadOne(CAddrSpace::Browser &browser, Fetch &fetch)
{
    if (FAILED(browser.open(fetch.url.c_str()))) {
        fetch.result = OPC_E_UNKNOWNITEMID;
        fetch.done = true;
        return;
    }
    BrowseRecord record = {};
    while (SUCCEEDED(browser.next(&record))) {
        try {
            fetch.records.push_back(record);
        } catch (const std::bad_alloc &) {
            SysFreeString(record.name);
            SysFreeString(record.description);
            return; // left undone: the lookup reads it again
        }
        record = {};
    }
    fetch.done = true;
}

// Reads the fetches on this thread and up to kMostReaders - 1 of the
// process's thread pool (threads it keeps: starting threads for each call
// would cost more than a read), each with a session of its own. A fetch
// that no reader could take stays undone.
class Readers {
public:
    Readers(std::vector<Fetch> &fetches, const CAddrSpace::BrowserSource &source) : m_fetches(fetches), m_source(source)
    {
    }
    void ReadAll()
    {
        size_t wanted = m_fetches.size() < kMostReaders ? m_fetches.size() : kMostReaders;
        PTP_WORK work = wanted > 1 ? CreateThreadpoolWork(&Readers::Work, this, nullptr) : nullptr;
        for (size_t i = 1; work && i < wanted; ++i)
            SubmitThreadpoolWork(work);
        Read();
        if (work) {
            WaitForThreadpoolWorkCallbacks(work, FALSE);
            CloseThreadpoolWork(work);
        }
    }

private:
    static void CALLBACK Work(PTP_CALLBACK_INSTANCE, void *context, PTP_WORK)
    {
        static_cast<Readers *>(context)->Read();
    }
    void Read() noexcept
    {
        try {
            CAddrSpace::Browser browser;
            if (!m_source(browser))
                return;
            for (size_t i; (i = m_next.fetch_add(1)) < m_fetches.size();)
                if (m_fetches[i].result == S_OK)
                    ReadOne(browser, m_fetches[i]);
        } catch (const std::exception &) {
            // No memory for a session: what this reader took stays undone.
        }
    }

    std::vector<Fetch> &m_fetches;
    const CAddrSpace::BrowserSource &m_source;
    std::atomic<size_t> m_next{0};
};

// The text before an identifier's last separator: identifiers of one object,
// which clients list together, have the same one and lead to the same
// branches.
std::wstring_view ParentText(std::wstring_view itemId)
{
    size_t last = itemId.find_last_of(L".\\");
    return last == std::wstring_view::npos ? itemId : itemId.substr(0, last);
}
} // namespace

void CAddrSpace::ReadAhead(const std::vector<std::wstring_view> &itemIds)
{
    const uint64_t pass = CCallPass::Current();
    if (pass == 0 || itemIds.size() < 2)
        return;
    for (int round = 0; round < kMostRounds; ++round)
        if (!ReadAheadRound(itemIds, pass))
            return;
}

bool CAddrSpace::ReadAheadRound(const std::vector<std::wstring_view> &itemIds, uint64_t pass)
{
    std::vector<Fetch> fetches;
    BrowserSource parallel;
    {
        CSingleLock lock(&m_lock);
        if (!m_parallelSource)
            return false;
        parallel = m_parallelSource;
        std::unordered_set<const CAddrNode *> chosen;
        // Each parent walked once, wherever its identifiers stand in the
        // list: a client may add the members of many objects interleaved.
        std::unordered_set<std::wstring_view> walked;
        walked.reserve(itemIds.size() / 8);
        for (size_t i = 0; i < itemIds.size(); ++i) {
            if (!walked.insert(ParentText(itemIds[i])).second)
                continue;
            AddrNodePtr toRead;
            if (NextRead(m_root, itemIds[i], pass, toRead) == Ahead::Read && chosen.insert(toRead.get()).second) {
                fetches.emplace_back();
                fetches.back().node = std::move(toRead);
            }
        }
        if (fetches.empty())
            return false;
        if (fetches.size() == 1) {
            // One branch: read as the lookup would, under the lock.
            Refresh(fetches.front().node);
            return true;
        }
        for (Fetch &fetch : fetches) {
            if (fetch.node->IsDetached() || !fetch.node->ItemId(fetch.url)) {
                fetch.result = OPC_E_UNKNOWNITEMID; // as ReadChildren finds it
                fetch.done = true;
            }
        }
    }
    Readers(fetches, parallel).ReadAll(); // without the tree's lock: other calls' lookups go on
    CSingleLock lock(&m_lock);
    bool any = false;
    for (Fetch &fetch : fetches) {
        CAddrNode::Branch &branch = *fetch.node->m_branch;
        if (!fetch.done || branch.refreshPass == pass)
            continue;
        // Dropped by another call's refresh meanwhile: as ReadChildren finds it.
        HRESULT result = fetch.node->IsDetached() ? OPC_E_UNKNOWNITEMID : fetch.result;
        if (SUCCEEDED(result)) {
            size_t i = 0;
            MergeRecords(fetch.node, [&](BrowseRecord *record) {
                if (i == fetch.records.size())
                    return E_FAIL;
                *record = fetch.records[i];
                fetch.records[i++] = {}; // the merge frees it
                return S_OK;
            });
        }
        branch.refreshPass = pass;
        branch.refreshResult = result;
        any = true;
    }
    return any;
}
