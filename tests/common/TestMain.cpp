// Test programs run in the multithreaded apartment, as the server does, and
// serve a simulated network of their own to the objects they make in
// process (a server process they start reaches the network node).
#include "CadroSim.h"
#include "ExitWatchdog.h"

#include <gtest/gtest.h>
#include <objbase.h>

#include <cstdio>
#include <memory>

namespace {
// Once the results are printed, the program's way out (the listeners' own
// ends, COM's uninitialisation) may take this long before the program is
// ended with its result: a hang there would cost the suite this test's whole
// time limit and leave its processes behind.
constexpr DWORD kExitBoundMs = 60000;
std::unique_ptr<CExitWatchdog> g_exitWatchdog;

class BoundedExit : public testing::EmptyTestEventListener {
    // Called before the listeners appended earlier end.
    void OnTestProgramEnd(const testing::UnitTest &unit) override
    {
        fflush(stdout);
        fflush(stderr);
        g_exitWatchdog = std::make_unique<CExitWatchdog>(kExitBoundMs, unit.Passed() ? 0u : 1u);
    }
};
} // namespace

int main(int argc, char **argv)
{
    // The programs this one starts, and the servers and network nodes that
    // they start in turn, must not hold the test runner's output open: the
    // runner waits for every holder before it counts the test as ended.
    for (DWORD std : {STD_INPUT_HANDLE, STD_OUTPUT_HANDLE, STD_ERROR_HANDLE})
        SetHandleInformation(GetStdHandle(std), HANDLE_FLAG_INHERIT, 0);
    testing::InitGoogleTest(&argc, argv);
    testing::UnitTest::GetInstance()->listeners().Append(new BoundedExit);
    CadroSim_UseEmbeddedNetwork();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int rc = RUN_ALL_TESTS();
    CoUninitialize();
    // Ended here, without the static objects' destructors and the libraries'
    // detach: their results are printed, and a detach that blocks (seen under
    // Wine) would outlast the watchdog.
    fflush(stdout);
    fflush(stderr);
    TerminateProcess(GetCurrentProcess(), static_cast<UINT>(rc));
    return rc;
}
