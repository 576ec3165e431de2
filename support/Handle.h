#pragma once
// Owning wrapper for a Win32 kernel handle.
#include <windows.h>

class UniqueHandle {
public:
    UniqueHandle() = default;
    explicit UniqueHandle(HANDLE h) : m_h(h == INVALID_HANDLE_VALUE ? nullptr : h) {}
    ~UniqueHandle() { Reset(); }
    UniqueHandle(const UniqueHandle &) = delete;
    UniqueHandle &operator=(const UniqueHandle &) = delete;
    UniqueHandle(UniqueHandle &&o) noexcept : m_h(o.m_h) { o.m_h = nullptr; }
    UniqueHandle &operator=(UniqueHandle &&o) noexcept
    {
        if (this != &o) {
            Reset();
            m_h = o.m_h;
            o.m_h = nullptr;
        }
        return *this;
    }

    // False when closing failed (the handle is forgotten either way).
    bool Reset(HANDLE h = nullptr)
    {
        bool ok = true;
        if (m_h)
            ok = CloseHandle(m_h) != FALSE;
        m_h = h;
        return ok;
    }
    HANDLE Get() const { return m_h; }
    explicit operator bool() const { return m_h != nullptr; }

private:
    HANDLE m_h = nullptr;
};
