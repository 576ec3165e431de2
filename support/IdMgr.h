#pragma once
// The one process-wide allocator of server handles, transaction ids, advise
// tokens and generated group-name numbers. Hands out the lowest free number and
// delays the reuse of given-back numbers as long as possible.
#include "RangeSet.h"
#include "SyncObject.h"

class CIdMgr : public CCriticalSection {
public:
    CIdMgr();
    // An allocator whose available set is low..high (tests use small spaces).
    CIdMgr(unsigned long low, unsigned long high);
    ~CIdMgr() override = default;

    // 0 means that no number is left.
    unsigned long GetId();
    void ReleaseId(unsigned long id);

    static CIdMgr &Instance();

private:
    CRangeSet<unsigned long> m_first;
    CRangeSet<unsigned long> m_second;
    CRangeSet<unsigned long> *m_available;
    CRangeSet<unsigned long> *m_released;
};

// Characters a generated group name needs: "$Group_" + 10 digits + "$" + NUL.
constexpr int kDefaultGroupNameChars = 19;

// Writes "$Group_<n>$" with a fresh number into buffer and returns buffer.
wchar_t *MakeDefaultGroupName(wchar_t *buffer);
