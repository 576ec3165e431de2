#include "KnownMembers.h"

#include <algorithm>

namespace cadrosim {

namespace {
// Beyond this many confirmed URLs the set starts again rather than grow
// without end (a client that browses a huge network).
constexpr size_t kMostListed = 4u << 20;
} // namespace

void KnownMembers::AddListed(const std::vector<uint64_t> &urlHashes)
{
    if (m_listed.Size() + urlHashes.size() > kMostListed)
        m_listed.Clear();
    for (uint64_t hash : urlHashes)
        m_listed.Insert(hash);
}

bool KnownMembers::InCatalogue(uint64_t catalogueHash) const
{
    return std::binary_search(m_catalogue.begin(), m_catalogue.end(), catalogueHash);
}

unsigned KnownMembers::BeginFetch()
{
    m_state = Catalogue::Fetching;
    return m_epoch;
}

bool KnownMembers::Fetched(unsigned ticket, bool whole, std::vector<uint64_t> hashes)
{
    if (ticket != m_epoch)
        return false;
    if (!std::is_sorted(hashes.begin(), hashes.end()))
        std::sort(hashes.begin(), hashes.end());
    m_state = whole ? Catalogue::Current : Catalogue::Refused;
    m_catalogue.swap(hashes);
    return true;
}

void KnownMembers::Forget()
{
    m_listed.Clear();
    std::vector<uint64_t>().swap(m_catalogue);
    m_state = Catalogue::Stale;
    ++m_epoch;
}

} // namespace cadrosim
