// The proxy/stub frees what its stub unmarshals. A server object of this
// process, in the multithreaded apartment, is called from a single-threaded
// one: every call goes through the registered proxy/stub and the platform's
// interpreted stub, as from another process, and the heaps of this process
// show what the stub keeps. Arrays of item definitions and of VARIANTs are
// allocated by the stub; it used to free their contents but not the arrays.
#include "ComPtr.h"
#include "InProcServer.h"
#include "ItemDefinitions.h"
#include "opcda.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <climits>
#include <string>
#include <thread>
#include <vector>

namespace {
const DWORD kCount = 1000;
const int kCalls = 20;
const int kRounds = 3;

// Bytes in use in every heap of this process.
unsigned long long BusyBytes()
{
    HANDLE heaps[256];
    DWORD count = GetProcessHeaps(256, heaps);
    unsigned long long busy = 0;
    for (DWORD h = 0; h < count && h < 256; ++h) {
        if (!HeapLock(heaps[h]))
            continue;
        PROCESS_HEAP_ENTRY entry = {};
        while (HeapWalk(heaps[h], &entry))
            if (entry.wFlags & PROCESS_HEAP_ENTRY_BUSY)
                busy += entry.cbData;
        HeapUnlock(heaps[h]);
    }
    return busy;
}

struct Growth {
    HRESULT setUp = E_FAIL;
    long long validateBytes = 0;
    long long writeBytes = 0;
};

// Heap growth per kCalls calls of ValidateItems and of a synchronous Write,
// each with kCount elements, made through the proxy after a few calls to
// warm up.
void MeasureThroughProxy(IStream *marshalled, Growth &out)
{
    CoInitializeEx(nullptr, COINIT_APARTMENTTHREADED);
    {
        ComPtr<IOPCItemMgt> items;
        out.setUp = CoGetInterfaceAndReleaseStream(marshalled, IID_IOPCItemMgt, reinterpret_cast<void **>(items.Out()));
        ComPtr<IOPCSyncIO> io;
        if (SUCCEEDED(out.setUp))
            out.setUp = items.As(io);
        if (SUCCEEDED(out.setUp)) {
            std::vector<std::wstring> ids(kCount, L"\\\\.\\proc1\\Setpoints.temperature");
            std::vector<OPCITEMDEF> defs = ActiveDefinitions(ids);
            auto validate = [&] {
                OPCITEMRESULT *results = nullptr;
                HRESULT *errors = nullptr;
                items->ValidateItems(kCount, defs.data(), FALSE, &results, &errors);
                CoTaskMemFree(results);
                CoTaskMemFree(errors);
            };
            // Text values, and handles that name no item: the stub
            // unmarshals every VARIANT before the group refuses them.
            std::vector<OPCHANDLE> handles(kCount, 0xDEADBEEF);
            std::vector<VARIANT> values(kCount);
            for (VARIANT &v : values) {
                VariantInit(&v);
                V_VT(&v) = VT_BSTR;
                V_BSTR(&v) = SysAllocString(L"a value long enough to matter");
            }
            auto write = [&] {
                HRESULT *errors = nullptr;
                io->Write(kCount, handles.data(), values.data(), &errors);
                CoTaskMemFree(errors);
            };
            for (int i = 0; i < 3; ++i) {
                validate();
                write();
            }
            // Other threads of this process (the network's intake, the
            // scanner) allocate too: the smallest growth of a few rounds is
            // the stub's, since a leak shows in every round.
            out.validateBytes = out.writeBytes = LLONG_MAX;
            for (int round = 0; round < kRounds; ++round) {
                unsigned long long before = BusyBytes();
                for (int i = 0; i < kCalls; ++i)
                    validate();
                unsigned long long middle = BusyBytes();
                for (int i = 0; i < kCalls; ++i)
                    write();
                unsigned long long after = BusyBytes();
                out.validateBytes = std::min(out.validateBytes, static_cast<long long>(middle - before));
                out.writeBytes = std::min(out.writeBytes, static_cast<long long>(after - middle));
            }
            for (VARIANT &v : values)
                VariantClear(&v);
        }
    }
    CoUninitialize();
}
} // namespace

TEST(StubMemory, ArraysTheStubAllocatesAreFreedAfterEachCall)
{
    ComPtr<IOPCServer> server = CreateInProcServer();
    ASSERT_TRUE(server);
    AddedGroup group = AddGroup(server.Get(), L"stub memory");
    ASSERT_EQ(group.hr, S_OK);
    IStream *marshalled = nullptr;
    ASSERT_EQ(CoMarshalInterThreadInterfaceInStream(IID_IOPCItemMgt, group.group.Get(), &marshalled), S_OK);

    Growth growth;
    std::thread caller(MeasureThroughProxy, marshalled, std::ref(growth));
    caller.join();
    ASSERT_EQ(growth.setUp, S_OK);
    // What a leak would keep: every call's array (OPCITEMDEF is 48 bytes,
    // VARIANT 24). A quarter of that is left for the heaps' own bookkeeping
    // and what other threads hold at the moment of measuring.
    EXPECT_LT(growth.validateBytes, static_cast<long long>(kCalls * kCount * sizeof(OPCITEMDEF) / 4));
    EXPECT_LT(growth.writeBytes, static_cast<long long>(kCalls * kCount * sizeof(VARIANT) / 4));
    server->RemoveGroup(group.handle, TRUE);
}
