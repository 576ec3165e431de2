// activation_client: one client of the server, as a plant's clients connect.
// It may wait for a start event (so that many start at one moment) and a
// delay, then makes one CoCreateInstance of the server out of process, reads
// one item from the device in a group of its own, may hold the server a
// while, and releases everything. It prints one line:
//   ok ACTIVATION_MS
//   fail 0xHRESULT ACTIVATION_MS STEP
// and exits with 0 or 1. No retries: every failed activation is counted,
// unless --retry-platform-fault is given: then an activation that fails with
// ERROR_NOACCESS is made once more, and "ok" says so ("ok MS after 0x...").
// Under Wine, when two server processes start at one moment, the new
// process's COM runtime now and then faults (a call through a null pointer,
// inside its own stub machinery) while it serves the client's first
// reference count on the class object; the client's activation then fails
// with that code, although the server goes on serving. A client can only
// try again, as this one does.
//
//   activation_client [--event NAME] [--delay MS] [--hold MS] [--item ID] [--retry-platform-fault]
#include "ComPtr.h"
#include "opcda.h"

#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <string>

namespace {
const CLSID kServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

// A failure says when the activation began (the system's tick count, the
// same in every process) so that it can be laid beside the server's traces.
int Report(HRESULT hr, ULONGLONG begin, ULONGLONG activationMs, const char *step, HRESULT retriedAfter)
{
    if (SUCCEEDED(hr) && retriedAfter != S_OK)
        printf("ok %llu after 0x%08lX\n", activationMs, static_cast<unsigned long>(retriedAfter));
    else if (SUCCEEDED(hr))
        printf("ok %llu\n", activationMs);
    else
        printf("fail 0x%08lX %llu %s at %llu\n", static_cast<unsigned long>(hr), activationMs, step, begin);
    fflush(stdout);
    return SUCCEEDED(hr) ? 0 : 1;
}

HRESULT ReadOne(IOPCServer *server, const std::wstring &item, const char *&step)
{
    OPCHANDLE group = 0;
    DWORD rate = 0;
    ComPtr<IOPCItemMgt> items;
    step = "AddGroup";
    HRESULT hr = server->AddGroup(L"", TRUE, 1000, 0, nullptr, nullptr, 0, &group, &rate, IID_IOPCItemMgt,
                                  reinterpret_cast<IUnknown **>(items.Out()));
    if (FAILED(hr))
        return hr;
    OPCITEMDEF def = {};
    def.szItemID = const_cast<wchar_t *>(item.c_str());
    def.bActive = TRUE;
    OPCITEMRESULT *results = nullptr;
    HRESULT *errors = nullptr;
    step = "AddItems";
    hr = items->AddItems(1, &def, &results, &errors);
    OPCHANDLE handle = hr == S_OK ? results[0].hServer : 0;
    CoTaskMemFree(results);
    CoTaskMemFree(errors);
    if (hr == S_OK) {
        ComPtr<IOPCSyncIO> io;
        step = "Read";
        hr = items.As(io);
        OPCITEMSTATE *states = nullptr;
        if (SUCCEEDED(hr))
            hr = io->Read(OPC_DS_DEVICE, 1, &handle, &states, &errors);
        if (hr == S_OK) {
            VariantClear(&states[0].vDataValue);
            hr = errors[0];
        }
        CoTaskMemFree(states);
        CoTaskMemFree(errors);
    }
    items.Reset();
    HRESULT removed = server->RemoveGroup(group, FALSE);
    if (SUCCEEDED(hr) && FAILED(removed)) {
        step = "RemoveGroup";
        hr = removed;
    }
    return hr;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    std::wstring event, item = L"\\\\.\\proc1\\Setpoints.temperature";
    DWORD delayMs = 0, holdMs = 0;
    bool retryPlatformFault = false;
    for (int i = 1; i < argc; ++i) {
        std::wstring option = argv[i];
        if (option == L"--retry-platform-fault") {
            retryPlatformFault = true;
            continue;
        }
        if (i + 1 == argc)
            break;
        if (option == L"--event")
            event = argv[i + 1];
        else if (option == L"--delay")
            delayMs = wcstoul(argv[i + 1], nullptr, 10);
        else if (option == L"--hold")
            holdMs = wcstoul(argv[i + 1], nullptr, 10);
        else if (option == L"--item")
            item = argv[i + 1];
        ++i;
    }
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    if (!event.empty()) {
        HANDLE start = OpenEventW(SYNCHRONIZE, FALSE, event.c_str());
        if (start) {
            WaitForSingleObject(start, 60000);
            CloseHandle(start);
        }
    }
    Sleep(delayMs);
    ULONGLONG begin = GetTickCount64();
    ComPtr<IOPCServer> server;
    HRESULT hr = CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                  reinterpret_cast<void **>(server.Out()));
    HRESULT retriedAfter = S_OK;
    if (retryPlatformFault && hr == HRESULT_FROM_WIN32(ERROR_NOACCESS)) {
        retriedAfter = hr;
        hr = CoCreateInstance(kServer, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                              reinterpret_cast<void **>(server.Out()));
    }
    ULONGLONG activationMs = GetTickCount64() - begin;
    const char *step = "CoCreateInstance";
    if (SUCCEEDED(hr))
        hr = ReadOne(server.Get(), item, step);
    Sleep(holdMs);
    server.Reset();
    int code = Report(hr, begin, activationMs, step, retriedAfter);
    // Leaves without COM's uninitialisation, which a client has no need of
    // and which could only add a hang of its own to the figures.
    ExitProcess(static_cast<UINT>(code));
}
