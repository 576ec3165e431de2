// The control tool, a separate process, publishes into this process's
// running network and a subscriber here sees the value.
#include "ChildProcess.h"
#include "SimFixture.h"

namespace {
std::wstring ToolPath()
{
    wchar_t self[MAX_PATH];
    GetModuleFileNameW(nullptr, self, MAX_PATH);
    std::wstring path(self);
    return path.substr(0, path.find_last_of(L'\\') + 1) + L"cadroctl.exe";
}

// Runs cadroctl with arguments; returns its exit code and its output.
DWORD RunTool(const std::wstring &arguments, std::string &output)
{
    return static_cast<DWORD>(RunAndCapture(L"\"" + ToolPath() + L"\" " + arguments, output));
}
} // namespace

TEST_F(SimTest, ControlToolPublishesIntoTheRunningNetwork)
{
    Subscribe(L"\\\\.\\p\\o.ro");
    void *cookie = LastCookie();
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, cookie, 5); }));

    std::string out;
    std::wstring pid = std::to_wstring(GetCurrentProcessId());
    EXPECT_EQ(RunTool(L"--pid " + pid + L" publish \\\\.\\p\\o.ro 123.25", out), 0u) << out;
    ASSERT_TRUE(recorder.WaitFor([&](auto &all) { return HasData(all, cookie, 123.25); }));

    EXPECT_EQ(RunTool(L"--pid " + pid + L" list-subscriptions", out), 0u);
    EXPECT_NE(out.find("ro subscriptions=1 value=123.25"), std::string::npos) << out;
    EXPECT_EQ(RunTool(L"--pid " + pid + L" publish \\\\.\\p\\o.missing 1", out), 1u);
    EXPECT_NE(out.find("unknown data member"), std::string::npos) << out;
    EXPECT_EQ(RunTool(L"--help", out), 0u);
    EXPECT_NE(out.find("usage: cadroctl"), std::string::npos);
    EXPECT_EQ(RunTool(L"publish --help", out), 0u);
    EXPECT_NE(out.find("quality=good|bad"), std::string::npos);
    EXPECT_EQ(RunTool(L"--pid 1 status", out), 2u) << "no network in that process";
}
