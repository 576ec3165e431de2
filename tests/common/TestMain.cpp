// Test programs run in the multithreaded apartment, as the server does, and
// serve a simulated network of their own to the objects they make in
// process (a server process they start reaches the network node).
#include "CadroSim.h"
#include "ExitWatchdog.h"
#include "TestProgress.h"

#include <gtest/gtest.h>
#include <objbase.h>

#include <atomic>
#include <cstdio>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

namespace {
// Once the results are printed, the program's way out (the listeners' own
// ends, COM's uninitialisation) may take this long before the program is
// ended with its result: a hang there would cost the suite this test's whole
// time limit and leave its processes behind.
constexpr DWORD kExitBoundMs = 60000;
std::unique_ptr<CExitWatchdog> g_exitWatchdog;

std::atomic<const char *> g_step{""};

// A test still running after kLongTestMs has its name and last step printed
// (once), and every failure is flushed at once: a hang that the runner ends
// by killing the program would otherwise leave no trace of where it was.
constexpr DWORD kLongTestMs = 200000;
class HangReport : public testing::EmptyTestEventListener {
public:
    HangReport() : m_wake(CreateEventW(nullptr, FALSE, FALSE, nullptr))
    {
        std::thread([this] { Watch(); }).detach(); // lives as long as the program
    }

private:
    void OnTestStart(const testing::TestInfo &test) override
    {
        g_step = "";
        {
            std::lock_guard<std::mutex> l(m_nameLock);
            m_name = std::string(test.test_suite_name()) + "." + test.name();
        }
        m_started = GetTickCount64();
        m_running = true;
        SetEvent(m_wake);
    }
    void OnTestEnd(const testing::TestInfo &) override { m_running = false; }
    void OnTestPartResult(const testing::TestPartResult &) override
    {
        fflush(stdout);
        fflush(stderr);
    }
    void Watch()
    {
        for (;;) {
            WaitForSingleObject(m_wake, INFINITE);
            ULONGLONG started = m_started;
            while (m_running && m_started == started && GetTickCount64() - started < kLongTestMs)
                Sleep(1000);
            if (m_running && m_started == started) {
                std::lock_guard<std::mutex> l(m_nameLock);
                printf("\n%s is still running after %lu s; its last step: %s\n", m_name.c_str(),
                       static_cast<unsigned long>(kLongTestMs / 1000), g_step.load());
                fflush(stdout);
            }
        }
    }

    HANDLE m_wake; // the program's life long
    std::mutex m_nameLock;
    std::string m_name;
    std::atomic<ULONGLONG> m_started{0};
    std::atomic<bool> m_running{false};
};

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

void TestStep(const char *step)
{
    g_step = step;
}

int main(int argc, char **argv)
{
    // The programs this one starts, and the servers and network nodes that
    // they start in turn, must not hold the test runner's output open: the
    // runner waits for every holder before it counts the test as ended.
    for (DWORD std : {STD_INPUT_HANDLE, STD_OUTPUT_HANDLE, STD_ERROR_HANDLE})
        SetHandleInformation(GetStdHandle(std), HANDLE_FLAG_INHERIT, 0);
    testing::InitGoogleTest(&argc, argv);
    testing::UnitTest::GetInstance()->listeners().Append(new HangReport);
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
