#pragma once
// RAII for memory from the COM task allocator, which belongs to the client once
// handed over (Detach).
#include <objbase.h>

#include <cstddef>
#include <cwchar>
#include <new>

template <class T> class TaskMem {
public:
    TaskMem() = default;
    explicit TaskMem(T *p) : m_p(p) {}
    ~TaskMem() { CoTaskMemFree(m_p); }
    TaskMem(const TaskMem &) = delete;
    TaskMem &operator=(const TaskMem &) = delete;
    TaskMem(TaskMem &&o) noexcept : m_p(o.m_p) { o.m_p = nullptr; }

    // Zeroed array of count elements; false when out of memory.
    bool Allocate(size_t count)
    {
        Reset();
        if (count > static_cast<size_t>(-1) / sizeof(T))
            return false;
        size_t bytes = count * sizeof(T);
        m_p = static_cast<T *>(CoTaskMemAlloc(bytes ? bytes : 1));
        if (m_p)
            ZeroMemory(m_p, bytes);
        return m_p != nullptr;
    }
    void Reset(T *p = nullptr)
    {
        CoTaskMemFree(m_p);
        m_p = p;
    }
    T *Detach()
    {
        T *p = m_p;
        m_p = nullptr;
        return p;
    }
    T *Get() const { return m_p; }
    T &operator[](size_t i) const { return m_p[i]; }
    T *operator->() const { return m_p; }
    explicit operator bool() const { return m_p != nullptr; }

private:
    T *m_p = nullptr;
};

// Copy of a wide string in task memory, or null when out of memory.
inline wchar_t *TaskStrDup(const wchar_t *s)
{
    size_t bytes = (wcslen(s) + 1) * sizeof(wchar_t);
    auto *copy = static_cast<wchar_t *>(CoTaskMemAlloc(bytes));
    if (copy)
        memcpy(copy, s, bytes);
    return copy;
}
