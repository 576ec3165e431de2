// second_server: a server process beside the one COM starts. The server's
// objects live in this process with network libraries of their own, which
// reach the same network node. It adds one active item and prints every
// value its data callback receives ("value V") until a given value arrives
// or the seconds run out.
#include "ClassFactory.h"
#include "ComPtr.h"
#include "opcda.h"

#include <cmath>
#include <cstdio>
#include <cwchar>
#include <ocidl.h>

namespace {
class PrintingSink : public IOPCDataCallback {
public:
    PrintingSink(double last, HANDLE done) : m_last(last), m_done(done) {}
    STDMETHODIMP QueryInterface(REFIID riid, void **ppv) override
    {
        if (!ppv)
            return E_POINTER;
        if (IsEqualIID(riid, IID_IUnknown) || IsEqualIID(riid, IID_IOPCDataCallback)) {
            *ppv = static_cast<IOPCDataCallback *>(this);
            return S_OK;
        }
        *ppv = nullptr;
        return E_NOINTERFACE;
    }
    STDMETHODIMP_(ULONG) AddRef() override { return 2; } // lives in main
    STDMETHODIMP_(ULONG) Release() override { return 1; }
    STDMETHODIMP OnDataChange(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD count, OPCHANDLE *, VARIANT *values, WORD *,
                              FILETIME *, HRESULT *) override
    {
        for (DWORD i = 0; i < count; ++i) {
            VARIANT number = {};
            if (SUCCEEDED(VariantChangeType(&number, &values[i], 0, VT_R8))) {
                printf("value %.17g\n", V_R8(&number));
                if (V_R8(&number) == m_last)
                    SetEvent(m_done);
            }
        }
        fflush(stdout);
        return S_OK;
    }
    STDMETHODIMP OnReadComplete(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD, OPCHANDLE *, VARIANT *, WORD *, FILETIME *,
                                HRESULT *) override
    {
        return S_OK;
    }
    STDMETHODIMP OnWriteComplete(DWORD, OPCHANDLE, HRESULT, DWORD, OPCHANDLE *, HRESULT *) override { return S_OK; }
    STDMETHODIMP OnCancelComplete(DWORD, OPCHANDLE) override { return S_OK; }

private:
    double m_last;
    HANDLE m_done;
};

int Serve(const wchar_t *itemId, DWORD seconds, double last)
{
    CServerClassFactory factory;
    ComPtr<IOPCServer> server;
    if (FAILED(factory.CreateInstance(nullptr, IID_IOPCServer, reinterpret_cast<void **>(server.Out()))))
        return 1;
    OPCHANDLE group = 0;
    DWORD rate = 0;
    ComPtr<IOPCItemMgt> items;
    if (FAILED(server->AddGroup(L"second", TRUE, 50, 0, nullptr, nullptr, 0, &group, &rate, IID_IOPCItemMgt,
                                reinterpret_cast<IUnknown **>(items.Out()))))
        return 1;
    HANDLE done = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    PrintingSink sink(last, done);
    ComPtr<IConnectionPointContainer> container;
    ComPtr<IConnectionPoint> point;
    DWORD cookie = 0;
    if (FAILED(items.As(container)) || FAILED(container->FindConnectionPoint(IID_IOPCDataCallback, point.Out())) ||
        FAILED(point->Advise(&sink, &cookie)))
        return 1;
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(itemId);
    def.bActive = TRUE;
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    HRESULT hr = items->AddItems(1, &def, &results, &errors);
    printf("added 0x%08lX\n", static_cast<unsigned long>(hr == S_OK ? errors[0] : hr));
    fflush(stdout);
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    WaitForSingleObject(done, seconds * 1000);
    point->Unadvise(cookie);
    point.Reset();
    container.Reset();
    items.Reset();
    server->RemoveGroup(group, TRUE);
    CloseHandle(done);
    return 0;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc != 4) {
        fwprintf(stderr, L"usage: second_server <item id> <seconds> <last value>\n");
        return 2;
    }
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int code = Serve(argv[1], wcstoul(argv[2], nullptr, 10), _wtof(argv[3]));
    CoUninitialize();
    return code;
}
