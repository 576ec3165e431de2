#include "ClassObjectRegistration.h"

#include "CallWatcher.h"
#include "ComPtr.h"
#include "Trace.h"

#include <objbase.h>

#include <utility>

HRESULT CClassObjectRegistration::Register(Use use)
{
    if (m_cookie != 0)
        return S_OK;
    DWORD flags = use == Use::Shared ? REGCLS_MULTIPLEUSE : REGCLS_SINGLEUSE;
    return CoRegisterClassObject(m_clsid, static_cast<IUnknown *>(this), CLSCTX_LOCAL_SERVER | CLSCTX_REMOTE_SERVER,
                                 flags, &m_cookie);
}

HRESULT CClassObjectRegistration::Switch(Use use)
{
    if (m_cookie == 0)
        return Register(use);
    // The platform forgets a revoked registration in the process before it
    // tells the registry, and releases the object last, still holding the
    // lock that every lookup of a class object takes. Registered again from
    // that release, the class object is never missing for a lookup. Where
    // the release comes at another moment, the new registration follows the
    // revocation at once.
    m_switchTo = use;
    m_switchResult = S_OK;
    m_switchThread = GetCurrentThreadId();
    CoRevokeClassObject(std::exchange(m_cookie, 0));
    if (m_switchThread.exchange(0) != 0) {
        Trace("class object registered again after its revocation\n");
        return Register(use);
    }
    return m_switchResult;
}

STDMETHODIMP_(ULONG) CClassObjectRegistration::Release()
{
    DWORD self = GetCurrentThreadId();
    if (m_switchThread.load() == self && m_switchThread.compare_exchange_strong(self, 0))
        m_switchResult = Register(m_switchTo);
    return 1;
}

void CClassObjectRegistration::Revoke()
{
    if (m_cookie != 0)
        CoRevokeClassObject(std::exchange(m_cookie, 0));
}

STDMETHODIMP CClassObjectRegistration::QueryInterface(REFIID riid, void **ppv)
{
    if (!ppv)
        return E_POINTER;
    *ppv = nullptr;
    bool probe = CCallWatcher::TakeIncomingProbe();
    if (m_lifetime && !m_lifetime->ClassObjectQueried(probe))
        return E_NOINTERFACE;
    return m_factory.QueryInterface(riid, ppv);
}

void CClassObjectRegistration::Probe()
{
    // A thread for each probe: one that waits inside the platform (for a
    // server it started because the registry had nothing) is left to end
    // by itself.
    HANDLE thread = CreateThread(nullptr, 0, &ProbeThread, this, 0, nullptr);
    if (thread) {
        CloseHandle(thread);
        return;
    }
    INTERNAL_ASSERT_FAILED("CreateThread for the registry probe");
    if (m_lifetime)
        m_lifetime->ProbeFinished();
}

DWORD WINAPI CClassObjectRegistration::ProbeThread(void *param)
{
    auto *self = static_cast<CClassObjectRegistration *>(param);
    // An apartment of its own: from the process's multithreaded apartment
    // the lookup would find the class object here and never ask the registry.
    HRESULT init = CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    HRESULT hr = init;
    if (SUCCEEDED(init)) {
        CCallWatcher::ProbeScope scope;
        ComPtr<IClassFactory> factory;
        hr = CoGetClassObject(self->m_clsid, CLSCTX_LOCAL_SERVER, nullptr, IID_IClassFactory,
                              reinterpret_cast<void **>(factory.Out()));
    }
    Trace("lifetime %lu at %llu: probe returned 0x%08lX\n", GetCurrentProcessId(), GetTickCount64(),
          static_cast<unsigned long>(hr));
    if (SUCCEEDED(init))
        CoUninitialize();
    if (self->m_lifetime)
        self->m_lifetime->ProbeFinished();
    return 0;
}
