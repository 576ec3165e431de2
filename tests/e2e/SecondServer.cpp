// second_server: a server process beside the one COM starts. The server's
// objects live in this process with network libraries of their own, which
// reach the same network node. It adds one active item, waits until a given
// value arrives or the seconds run out, and prints every value its data
// callback received ("value V").
#include "ClassFactory.h"
#include "ComPtr.h"
#include "TestSink.h"
#include "opcda.h"

#include <cstdio>
#include <cwchar>
#include <ocidl.h>

namespace {
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
    TestSink sink;
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
    sink.WaitFor(
        [last](const std::vector<Callback> &calls) {
            for (const Callback &c : calls)
                for (double v : c.values)
                    if (v == last)
                        return true;
            return false;
        },
        static_cast<int>(seconds * 1000));
    for (const Callback &c : sink.Snapshot())
        for (double v : c.values)
            if (c.kind == Callback::DataChange)
                printf("value %.17g\n", v);
    point->Unadvise(cookie);
    point.Reset();
    container.Reset();
    items.Reset();
    server->RemoveGroup(group, TRUE);
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
