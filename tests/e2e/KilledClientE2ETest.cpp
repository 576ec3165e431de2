// A client process killed while the server calls it back. Its references are
// never released under Wine (Windows collects them after some minutes of
// missed pings), so the server outlives this test and is ended by it, and
// with it the class registration it could not revoke.
#include "ComPtr.h"
#include "Handle.h"
#include "OpcRunner.h"
#include "ServerProcess.h"
#include "opcda.h"

#include <gtest/gtest.h>

TEST(KilledClientE2E, TheServerGoesOnServingOtherClients)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    ComPtr<IOPCServer> server;
    ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                               reinterpret_cast<void **>(server.Out())),
              S_OK);

    // Killed at the time limit while its 20 ms group keeps calling it back.
    OpcRun victim = Opc(R"(subscribe \\.\proc1\Counters.fast --rate 20 --json)", 4000);
    EXPECT_EQ(victim.code, -1);
    EXPECT_TRUE(Has(victim.output, "Counters.fast")) << victim.output;

    // This client, and new ones, are served as before: the calls that go to
    // the dead process fail instead of holding the scanner up.
    Sleep(500);
    OpcRun after = Opc(R"(subscribe \\.\proc1\Counters.fast --rate 50 --count 3)");
    EXPECT_EQ(after.code, 0) << after.output;
    EXPECT_EQ(Lines(after.output).size(), 3u) << after.output;
    OPCSERVERSTATUS *status = nullptr;
    EXPECT_EQ(server->GetStatus(&status), S_OK);
    if (status) {
        CoTaskMemFree(status->szVendorInfo);
        CoTaskMemFree(status);
    }

    server.Reset();
    UniqueHandle stale(OpenProcess(PROCESS_TERMINATE | SYNCHRONIZE, FALSE, ServerProcessId()));
    if (stale && WaitForSingleObject(stale.Get(), 2000) == WAIT_TIMEOUT) {
        TerminateProcess(stale.Get(), 0);
        WaitForSingleObject(stale.Get(), 10000);
        // The ended server never revoked its class object, and Wine's rpcss
        // would hand it out to every later client: a new rpcss, which COM
        // starts at the next activation, knows nothing of it.
        UniqueHandle rpcss(OpenProcess(PROCESS_TERMINATE | SYNCHRONIZE, FALSE, ProcessIdOf(L"rpcss.exe")));
        if (rpcss) {
            TerminateProcess(rpcss.Get(), 0);
            WaitForSingleObject(rpcss.Get(), 10000);
        }
    }
    // The prefix is left as later tests need it.
    ComPtr<IOPCServer> again;
    EXPECT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                               reinterpret_cast<void **>(again.Out())),
              S_OK);
}
