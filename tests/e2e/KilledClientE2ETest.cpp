// A client process killed while the server calls it back. Its references are
// never released under Wine (Windows collects them after some minutes of
// missed pings), so the server outlives this test and is ended by it; the
// class registration it leaves behind makes this the last test of the suite
// (its own CTest entry).
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
    if (stale && WaitForSingleObject(stale.Get(), 2000) == WAIT_TIMEOUT)
        TerminateProcess(stale.Get(), 0);
}
