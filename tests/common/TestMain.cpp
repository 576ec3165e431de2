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
constexpr DWORD kExitBoundMs = 30000;
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
    testing::InitGoogleTest(&argc, argv);
    testing::UnitTest::GetInstance()->listeners().Append(new BoundedExit);
    CadroSim_UseEmbeddedNetwork();
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int rc = RUN_ALL_TESTS();
    CoUninitialize();
    return rc; // the watchdog is disarmed with the program's static objects
}
