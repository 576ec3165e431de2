#include "IdMgr.h"

#include <cwchar>
#include <utility>

// Numbers are 32-bit on every platform: unsigned long is 32-bit on Windows.
static_assert(sizeof(unsigned long) == 4, "identifiers are 32-bit");

namespace {
// Constructed during static initialisation, before the process entry runs.
CIdMgr g_idMgr;
} // namespace

CIdMgr::CIdMgr() : CIdMgr(1, 0xFFFFFFFFul) {}

CIdMgr::CIdMgr(unsigned long low, unsigned long high)
    : CCriticalSection(LockOrder::Leaf), m_first(low, high), m_available(&m_first), m_released(&m_second)
{
}

CIdMgr &CIdMgr::Instance()
{
    return g_idMgr;
}

unsigned long CIdMgr::GetId()
{
    CSingleLock lock(this);
    if (m_available->IsEmpty())
        std::swap(m_available, m_released);
    return m_available->TakeLowest();
}

void CIdMgr::ReleaseId(unsigned long id)
{
    CSingleLock lock(this);
    m_released->Insert(id);
}

wchar_t *MakeDefaultGroupName(wchar_t *buffer)
{
    unsigned long id = CIdMgr::Instance().GetId();
    swprintf(buffer, kDefaultGroupNameChars, L"$Group_%lu$", id);
    return buffer;
}
