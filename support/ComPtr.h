#pragma once
// Owning smart pointer for COM interfaces.
#include <unknwn.h>

#include <utility>

template <class T> class ComPtr {
public:
    ComPtr() = default;
    ComPtr(std::nullptr_t) {}
    // Adds a reference to p.
    explicit ComPtr(T *p) : m_p(p)
    {
        if (m_p)
            m_p->AddRef();
    }
    ComPtr(const ComPtr &o) : ComPtr(o.m_p) {}
    ComPtr(ComPtr &&o) noexcept : m_p(o.m_p) { o.m_p = nullptr; }
    ~ComPtr() { Reset(); }
    ComPtr &operator=(ComPtr o) noexcept
    {
        std::swap(m_p, o.m_p);
        return *this;
    }

    // Takes over a reference the caller already owns.
    static ComPtr Attach(T *p)
    {
        ComPtr r;
        r.m_p = p;
        return r;
    }
    T *Detach()
    {
        T *p = m_p;
        m_p = nullptr;
        return p;
    }
    void Reset()
    {
        if (m_p) {
            T *p = m_p;
            m_p = nullptr;
            p->Release();
        }
    }
    // Address for an out-parameter; releases what was held.
    T **Out()
    {
        Reset();
        return &m_p;
    }
    template <class U> HRESULT As(ComPtr<U> &out) const
    {
        return m_p ? m_p->QueryInterface(__uuidof(U), reinterpret_cast<void **>(out.Out())) : E_POINTER;
    }

    T *Get() const { return m_p; }
    T *operator->() const { return m_p; }
    explicit operator bool() const { return m_p != nullptr; }

private:
    T *m_p = nullptr;
};
