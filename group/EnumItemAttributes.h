#pragma once
// IEnumOPCItemAttributes over a snapshot of a group's items. Clones share
// the snapshot and keep it alive after the enumerator they came from is gone.
#include "ComObject.h"
#include "SyncObject.h"
#include "opcda.h"

#include <memory>
#include <vector>

// Records whose texts come from malloc; freed with the snapshot.
struct ItemAttributesSnapshot {
    std::vector<OPCITEMATTRIBUTES> records;
    ~ItemAttributesSnapshot();
};

class CEnumOPCItemAttributes : public CComObjectRoot, public IEnumOPCItemAttributes {
public:
    static HRESULT Create(std::shared_ptr<const ItemAttributesSnapshot> snapshot, size_t position, REFIID riid,
                          void **ppv);

    DECLARE_COM_UNKNOWN()

    STDMETHODIMP Next(ULONG celt, OPCITEMATTRIBUTES **ppItemArray, ULONG *pceltFetched) override;
    STDMETHODIMP Skip(ULONG celt) override;
    STDMETHODIMP Reset() override;
    STDMETHODIMP Clone(IEnumOPCItemAttributes **ppEnumItemAttributes) override;

protected:
    void *FindInterface(REFIID riid) override;

private:
    template <class T, class... Args> friend T *NewComObject(Args &&...args);
    CEnumOPCItemAttributes() = default;

    std::shared_ptr<const ItemAttributesSnapshot> m_snapshot;
    size_t m_position = 0;
    CCriticalSection m_lock; // Next, Skip and Reset each move the position as one step
};
