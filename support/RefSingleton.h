#pragma once
// A process-wide, reference-counted singleton: the first Acquire creates the
// instance, the last ReleaseInstance destroys it. T provides a default
// constructor and `HRESULT Start()`, which may fail.
#include "SyncObject.h"

#include <windows.h>

#include <memory>
#include <new>

template <class T> class CRefSingleton {
public:
    // Takes one reference and hands out the instance.
    static HRESULT Acquire(T **out)
    {
        CSingleLock lock(&s_lock);
        if (out)
            *out = nullptr;
        if (s_count++ == 0) {
            std::unique_ptr<T> fresh(new (std::nothrow) T());
            HRESULT hr = fresh ? fresh->Start() : E_OUTOFMEMORY;
            if (FAILED(hr)) {
                s_count = 0;
                return hr;
            }
            s_instance = fresh.release();
        }
        if (out)
            *out = s_instance;
        return S_OK;
    }

    // The last release destroys the instance after the lock: its thread
    // may be inside a client callback that creates a new server object in
    // this process, whose Acquire must not wait for that thread's end.
    static void ReleaseInstance()
    {
        std::unique_ptr<T> last;
        {
            CSingleLock lock(&s_lock);
            if (s_count <= 0)
                return;
            if (--s_count == 0) {
                last.reset(s_instance);
                s_instance = nullptr;
            }
        }
    }

    static LONG RefCount()
    {
        CSingleLock lock(&s_lock);
        return s_count;
    }

    // The live instance or null; callers that hold a reference may use it.
    static T *Instance() { return s_instance; }

private:
    inline static CCriticalSection s_lock;
    inline static LONG s_count = 0;
    inline static T *volatile s_instance = nullptr;
};
