#pragma once
// Checks of client-supplied pointers.
#include <windows.h>

// A non-null pointer that the process may write for size bytes.
inline bool IsWritable(const void *p, size_t size)
{
    return p != nullptr && !IsBadWritePtr(const_cast<void *>(p), size);
}
template <class T> bool IsWritableOut(T *p)
{
    return IsWritable(p, sizeof(T));
}
inline bool IsReadable(const void *p, size_t size)
{
    return p != nullptr && !IsBadReadPtr(p, size);
}
// A client's input array that the process can read for count (non-zero)
// elements; a count larger than the array is refused, not read past.
template <class T> bool IsReadableArray(const T *array, DWORD count)
{
    return array && count != 0 && IsReadable(array, static_cast<size_t>(count) * sizeof(T));
}

#include "Trace.h"

#include <new>

// Runs the body of a client-facing method: a thrown HRESULT becomes the
// result, memory exhaustion E_OUTOFMEMORY, anything else an internal
// assertion failure with E_FAIL.
template <class Body> HRESULT ComBoundary(Body body) noexcept
{
    try {
        return body();
    } catch (HRESULT hr) {
        return hr;
    } catch (const std::bad_alloc &) {
        return E_OUTOFMEMORY;
    } catch (...) {
        INTERNAL_ASSERT_FAILED("unexpected exception at the interface boundary");
        return E_FAIL;
    }
}
