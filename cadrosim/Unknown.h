#pragma once
// Reference counting and QueryInterface for the simulator's library objects.
#include <unknwn.h>

#include <atomic>

template <class Interface> class CSimUnknown : public Interface {
public:
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (!ppv)
            return E_POINTER;
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, __uuidof(Interface))) {
            *ppv = static_cast<Interface *>(this);
            AddRef();
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return ++m_refs; }
    STDMETHODIMP_(ULONG) Release() override
    {
        ULONG refs = --m_refs;
        if (refs == 0)
            LastRelease();
        return refs;
    }

protected:
    virtual ~CSimUnknown() = default;
    // Runs when the count reaches 0; deletes the object unless overridden.
    virtual void LastRelease() { delete this; }

private:
    std::atomic<ULONG> m_refs{1};
};
