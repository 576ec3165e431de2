// The control tool, a separate process, publishes into this process's
// running network and a subscriber here sees the value.
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
    SECURITY_ATTRIBUTES sa = {sizeof sa, nullptr, TRUE};
    HANDLE readEnd, writeEnd;
    CreatePipe(&readEnd, &writeEnd, &sa, 0);
    SetHandleInformation(readEnd, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW si = {};
    si.cb = sizeof si;
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdOutput = writeEnd;
    si.hStdError = writeEnd;
    PROCESS_INFORMATION pi = {};
    std::wstring line = L"\"" + ToolPath() + L"\" " + arguments;
    if (!CreateProcessW(nullptr, line.data(), nullptr, nullptr, TRUE, 0, nullptr, nullptr, &si, &pi)) {
        CloseHandle(readEnd);
        CloseHandle(writeEnd);
        return 999;
    }
    CloseHandle(writeEnd);
    char buffer[4096];
    DWORD got;
    output.clear();
    while (ReadFile(readEnd, buffer, sizeof buffer, &got, nullptr) && got)
        output.append(buffer, got);
    WaitForSingleObject(pi.hProcess, 30000);
    DWORD code = 999;
    GetExitCodeProcess(pi.hProcess, &code);
    CloseHandle(pi.hProcess);
    CloseHandle(pi.hThread);
    CloseHandle(readEnd);
    return code;
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
