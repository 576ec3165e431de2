#pragma once
// Minimal COM object framework: reference counting with atomic operations, the
// module lock count for the object's lifetime, interface lookup and optional
// aggregation (a controlling outer unknown).
#include <unknwn.h>

#include <new>

class CComObjectRoot {
public:
    // The object's own (non-delegating) unknown; its identity.
    IUnknown *InnerUnknown() { return &m_inner; }

    HRESULT OuterQueryInterface(REFIID riid, void **ppv);
    ULONG OuterAddRef();
    ULONG OuterRelease();

protected:
    explicit CComObjectRoot(IUnknown *outer = nullptr);
    virtual ~CComObjectRoot();
    CComObjectRoot(const CComObjectRoot &) = delete;
    CComObjectRoot &operator=(const CComObjectRoot &) = delete;

    // Pointer to the requested interface (IUnknown excluded) without a
    // reference added, or null.
    virtual void *FindInterface(REFIID riid) = 0;
    // Interfaces that are new objects on every query (the server's browse
    // interface); E_NOINTERFACE unless overridden.
    virtual HRESULT CreateOnQuery(REFIID, void **) { return E_NOINTERFACE; }
    // Runs once, before the destructor.
    virtual void FinalRelease() {}

    LONG RefCount() const { return m_refs; }

private:
    template <class T> friend HRESULT CreateComObject(T *object, REFIID riid, void **ppv);
    template <class T> friend void DiscardComObject(T *object);

    HRESULT InnerQueryInterface(REFIID riid, void **ppv);
    ULONG InnerAddRef();
    ULONG InnerRelease();

    struct Inner : IUnknown {
        CComObjectRoot *owner;
        STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override { return owner->InnerQueryInterface(riid, ppv); }
        STDMETHODIMP_(ULONG) AddRef() override { return owner->InnerAddRef(); }
        STDMETHODIMP_(ULONG) Release() override { return owner->InnerRelease(); }
    };

    Inner m_inner;
    volatile LONG m_refs = 0;
    IUnknown *m_outer;
};

// IUnknown of every interface of a class derived from CComObjectRoot.
#define DECLARE_COM_UNKNOWN()                                                                                          \
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override                                                      \
    {                                                                                                                  \
        return OuterQueryInterface(riid, ppv);                                                                         \
    }                                                                                                                  \
    STDMETHODIMP_(ULONG) AddRef() override                                                                             \
    {                                                                                                                  \
        return OuterAddRef();                                                                                          \
    }                                                                                                                  \
    STDMETHODIMP_(ULONG) Release() override                                                                            \
    {                                                                                                                  \
        return OuterRelease();                                                                                         \
    }

// Hands a freshly allocated object to the caller through its interface riid.
// The object is destroyed when the query fails.
template <class T> HRESULT CreateComObject(T *object, REFIID riid, void **ppv)
{
    if (!object)
        return E_OUTOFMEMORY;
    object->InnerAddRef();
    HRESULT hr = object->InnerQueryInterface(riid, ppv);
    object->InnerRelease();
    return hr;
}

// Destroys an object that nobody references yet (final release included).
template <class T> void DiscardComObject(T *object)
{
    if (!object)
        return;
    object->InnerAddRef();
    object->InnerRelease();
}

// The object factory: the one place where COM objects are allocated.
template <class T, class... Args> T *NewComObject(Args &&...args)
{
    return new (std::nothrow) T(static_cast<Args &&>(args)...);
}
