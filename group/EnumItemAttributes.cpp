#include "EnumItemAttributes.h"

#include "ComUtil.h"
#include "TaskMem.h"

#include <cstdlib>
#include <cstring>

namespace {
wchar_t *TaskCopy(const wchar_t *s)
{
    return s ? TaskStrDup(s) : nullptr;
}

void FreeTaskRecord(OPCITEMATTRIBUTES &r)
{
    CoTaskMemFree(r.szAccessPath);
    CoTaskMemFree(r.szItemID);
    CoTaskMemFree(r.pBlob);
    VariantClear(&r.vEUInfo);
}

// A deep copy with the COM task allocator; false when out of memory.
bool CopyRecord(OPCITEMATTRIBUTES &to, const OPCITEMATTRIBUTES &from)
{
    to = from;
    to.szAccessPath = TaskCopy(from.szAccessPath);
    to.szItemID = TaskCopy(from.szItemID);
    to.pBlob = nullptr;
    to.dwBlobSize = 0;
    VariantInit(&to.vEUInfo);
    bool ok = (to.szAccessPath || !from.szAccessPath) && (to.szItemID || !from.szItemID) &&
              SUCCEEDED(VariantCopy(&to.vEUInfo, const_cast<VARIANT *>(&from.vEUInfo)));
    if (from.pBlob && from.dwBlobSize) {
        to.pBlob = static_cast<BYTE *>(CoTaskMemAlloc(from.dwBlobSize));
        if (to.pBlob) {
            memcpy(to.pBlob, from.pBlob, from.dwBlobSize);
            to.dwBlobSize = from.dwBlobSize;
        } else {
            ok = false;
        }
    }
    return ok;
}
} // namespace

ItemAttributesSnapshot::~ItemAttributesSnapshot()
{
    for (auto &r : records) {
        free(r.szAccessPath);
        free(r.szItemID);
        free(r.pBlob);
        VariantClear(&r.vEUInfo);
    }
}

HRESULT CEnumOPCItemAttributes::Create(std::shared_ptr<const ItemAttributesSnapshot> snapshot, size_t position,
                                       REFIID riid, void **ppv)
{
    auto *e = NewComObject<CEnumOPCItemAttributes>();
    if (!e)
        return E_OUTOFMEMORY;
    e->m_snapshot = std::move(snapshot);
    e->m_position = position;
    return CreateComObject(e, riid, ppv);
}

void *CEnumOPCItemAttributes::FindInterface(REFIID riid)
{
    return IsEqualIID(riid, IID_IEnumOPCItemAttributes) ? static_cast<IEnumOPCItemAttributes *>(this) : nullptr;
}

STDMETHODIMP CEnumOPCItemAttributes::Next(ULONG celt, OPCITEMATTRIBUTES **ppItemArray, ULONG *pceltFetched)
{
    if (!ppItemArray || (celt != 1 && !pceltFetched))
        return E_POINTER;
    *ppItemArray = nullptr;
    if (pceltFetched)
        *pceltFetched = 0;
    CSingleLock lock(&m_lock);
    const auto &records = m_snapshot->records;
    if (records.empty())
        return S_FALSE;
    size_t remaining = records.size() - m_position;
    ULONG n = celt < remaining ? celt : static_cast<ULONG>(remaining);
    if (n == 0)
        return S_FALSE;
    TaskMem<OPCITEMATTRIBUTES> out;
    if (!out.Allocate(n))
        return S_FALSE;
    for (ULONG i = 0; i < n; ++i) {
        if (!CopyRecord(out[i], records[m_position + i])) {
            for (ULONG j = 0; j <= i; ++j)
                FreeTaskRecord(out[j]);
            return E_OUTOFMEMORY;
        }
    }
    m_position += n;
    *ppItemArray = out.Detach();
    if (pceltFetched)
        *pceltFetched = n;
    return n == celt ? S_OK : S_FALSE;
}

STDMETHODIMP CEnumOPCItemAttributes::Skip(ULONG celt)
{
    CSingleLock lock(&m_lock);
    size_t remaining = m_snapshot->records.size() - m_position;
    if (celt >= remaining) {
        m_position = m_snapshot->records.size();
        return S_FALSE;
    }
    m_position += celt;
    return S_OK;
}

STDMETHODIMP CEnumOPCItemAttributes::Reset()
{
    CSingleLock lock(&m_lock);
    m_position = 0;
    return S_OK;
}

STDMETHODIMP CEnumOPCItemAttributes::Clone(IEnumOPCItemAttributes **ppEnumItemAttributes)
{
    if (!ppEnumItemAttributes)
        return E_POINTER;
    *ppEnumItemAttributes = nullptr;
    CSingleLock lock(&m_lock);
    return Create(m_snapshot, m_position, IID_IEnumOPCItemAttributes, reinterpret_cast<void **>(ppEnumItemAttributes));
}
