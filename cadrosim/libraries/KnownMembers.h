#pragma once
// What a link knows of the members its node serves, so that subscribing to
// one need not wait for the node's answer: the member URLs that the node's
// listings confirmed, and the node's catalogue (the hash of every member URL
// it serves under its plain spelling), fetched once after each change of the
// network or of the connection. Both are forgotten on such a change.
//
// Not locked: the link holds its own lock around every call.
#include "HashSet64.h"

#include <cstdint>
#include <vector>

namespace cadrosim {

class KnownMembers {
public:
    enum class Catalogue { Stale, Fetching, Current, Refused };

    // Whether a listing confirmed the URL of this hash (wire::UrlHash).
    bool Listed(uint64_t urlHash) const { return m_listed.Contains(urlHash); }
    // Listings confirmed these; a set grown past its limit starts again.
    void AddListed(const std::vector<uint64_t> &urlHashes);

    Catalogue State() const { return m_state; }
    // Under Current: whether the catalogue names the member (a hash by
    // wire::CatalogueHash).
    bool InCatalogue(uint64_t catalogueHash) const;
    // A fetch begins; its ticket tells Fetched whether it is still current.
    unsigned BeginFetch();
    // The fetch of ticket ended (whole: the node answered with a whole
    // catalogue, in hashes); false when the knowledge was forgotten meanwhile
    // and the answer is out of date.
    bool Fetched(unsigned ticket, bool whole, std::vector<uint64_t> hashes);

    // The network or the connection changed.
    void Forget();

private:
    HashSet64 m_listed;
    Catalogue m_state = Catalogue::Stale;
    unsigned m_epoch = 0;              // moved on by each Forget
    std::vector<uint64_t> m_catalogue; // sorted
};

} // namespace cadrosim
