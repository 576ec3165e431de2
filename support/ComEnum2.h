#pragma once
// Vector enumerator for IEnumUnknown, IEnumString and the like. The owner holds the
// snapshot array; clones share it and keep the owner alive with a reference.
#include "ComObject.h"
#include "ComPtr.h"
#include "SyncObject.h"
#include "TaskMem.h"

#include <objidl.h>
#include <ocidl.h>

#include <vector>

// Interface pointers of type I (AddRef'd copies).
// kEmptyFails: Next of an empty enumerator answers E_FAIL, as the server's
// group and name enumerators do; a connection enumerator without a sink just
// runs out (S_FALSE), as every connection point's does.
template <class I> struct EnumCopyInterface {
    using Item = I *;
    static constexpr bool kEmptyFails = true;
    static constexpr bool kZeroNeedsNoArray = false;
    static bool Copy(Item &to, Item from)
    {
        to = from;
        if (from)
            from->AddRef();
        return true;
    }
    static void Destroy(Item item)
    {
        if (item)
            item->Release();
    }
};

using EnumCopyUnknown = EnumCopyInterface<IUnknown>;

struct EnumCopyConnection {
    using Item = CONNECTDATA;
    static constexpr bool kEmptyFails = false;
    static constexpr bool kZeroNeedsNoArray = false;
    static bool Copy(Item &to, const Item &from)
    {
        to = from;
        if (from.pUnk)
            from.pUnk->AddRef();
        return true;
    }
    static void Destroy(const Item &item)
    {
        if (item.pUnk)
            item.pUnk->Release();
    }
};

struct EnumCopyString {
    using Item = LPOLESTR;
    static constexpr bool kEmptyFails = true;
    static constexpr bool kZeroNeedsNoArray = false;
    static bool Copy(Item &to, Item from)
    {
        to = from ? TaskStrDup(from) : nullptr;
        return to != nullptr || from == nullptr;
    }
    static void Destroy(Item item) { CoTaskMemFree(item); }
};

// Plain values (GUIDs), copied as they are; an empty enumerator just runs out.
// A request for no element needs no array: a proxy sends none for it.
template <class T> struct EnumCopyValue {
    using Item = T;
    static constexpr bool kEmptyFails = false;
    static constexpr bool kZeroNeedsNoArray = true;
    static bool Copy(Item &to, const Item &from)
    {
        to = from;
        return true;
    }
    static void Destroy(const Item &) {}
};

template <class Interface, class Policy> class CComEnum2 : public CComObjectRoot, public Interface {
public:
    using Item = typename Policy::Item;
    // An enumerator that owns elements; with releaseItems it releases (or
    // frees) them when it is destroyed.
    static HRESULT Create(std::vector<Item> elements, bool releaseItems, REFIID riid, void **ppv)
    {
        auto *e = NewComObject<CComEnum2>();
        if (!e) {
            if (releaseItems)
                DestroyAll(elements);
            return E_OUTOFMEMORY;
        }
        e->m_own = std::move(elements);
        e->m_items = &e->m_own;
        e->m_releasesItems = releaseItems;
        return CreateComObject(e, riid, ppv);
    }

    DECLARE_COM_UNKNOWN()

    STDMETHODIMP Next(ULONG celt, Item *rgelt, ULONG *pceltFetched) override
    {
        if (pceltFetched)
            *pceltFetched = 0;
        if (celt == 0 && Policy::kZeroNeedsNoArray)
            return S_OK;
        if (!rgelt || (celt != 1 && !pceltFetched))
            return E_POINTER;
        CSingleLock lock(&m_lock);
        const std::vector<Item> &items = *m_items;
        if (items.empty() && Policy::kEmptyFails)
            return E_FAIL;
        size_t remaining = items.size() - m_index;
        ULONG count = celt < remaining ? celt : static_cast<ULONG>(remaining);
        for (ULONG i = 0; i < count; ++i) {
            if (!Policy::Copy(rgelt[i], items[m_index + i])) {
                for (ULONG j = 0; j < i; ++j) {
                    Policy::Destroy(rgelt[j]);
                    rgelt[j] = Item();
                }
                return E_OUTOFMEMORY;
            }
        }
        m_index += count;
        if (pceltFetched)
            *pceltFetched = count;
        return count < celt ? S_FALSE : S_OK;
    }

    STDMETHODIMP Skip(ULONG celt) override
    {
        CSingleLock lock(&m_lock);
        size_t remaining = m_items->size() - m_index;
        if (remaining < celt) {
            m_index = m_items->size();
            return S_FALSE;
        }
        m_index += celt;
        return S_OK;
    }

    STDMETHODIMP Reset() override
    {
        CSingleLock lock(&m_lock);
        m_index = 0;
        return S_OK;
    }

    STDMETHODIMP Clone(Interface **ppEnum) override
    {
        if (!ppEnum)
            return E_POINTER;
        *ppEnum = nullptr;
        auto *e = NewComObject<CComEnum2>();
        if (!e)
            return E_OUTOFMEMORY;
        CSingleLock lock(&m_lock);
        e->m_items = m_items;
        e->m_owner = m_owner ? m_owner : ComPtr<IUnknown>(InnerUnknown());
        e->m_index = m_index;
        return CreateComObject(e, __uuidof(Interface), reinterpret_cast<void **>(ppEnum));
    }

protected:
    void *FindInterface(REFIID riid) override
    {
        return IsEqualIID(riid, __uuidof(Interface)) ? static_cast<Interface *>(this) : nullptr;
    }
    void FinalRelease() override
    {
        if (m_releasesItems)
            DestroyAll(m_own);
        m_own.clear();
    }

private:
    static void DestroyAll(std::vector<Item> &items)
    {
        for (const Item &item : items)
            Policy::Destroy(item);
        items.clear();
    }

    std::vector<Item> m_own;
    const std::vector<Item> *m_items = &m_own;
    ComPtr<IUnknown> m_owner; // null for the enumerator that owns the array
    size_t m_index = 0;
    bool m_releasesItems = false; // the owner releases (or frees) its elements
    CCriticalSection m_lock;
};

using CEnumUnknown = CComEnum2<IEnumUnknown, EnumCopyUnknown>;
using CEnumString = CComEnum2<IEnumString, EnumCopyString>;
using CEnumConnections = CComEnum2<IEnumConnections, EnumCopyConnection>;
using CEnumConnectionPoints = CComEnum2<IEnumConnectionPoints, EnumCopyInterface<IConnectionPoint>>;
