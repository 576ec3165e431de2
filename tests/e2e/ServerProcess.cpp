#include "ServerProcess.h"

#include "CadroSim.h"
#include "Handle.h"

#include <gtest/gtest.h>

#include <tlhelp32.h>

#include <cstdlib>

const CLSID CLSID_SkylarcOPCServerE2E = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};

int CountServerProcesses()
{
    return CountProcesses(L"Local.exe");
}

int CountProcesses(const wchar_t *image)
{
    UniqueHandle snapshot(CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
    if (!snapshot)
        return -1;
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    int count = 0;
    for (BOOL more = Process32FirstW(snapshot.Get(), &entry); more; more = Process32NextW(snapshot.Get(), &entry)) {
        if (_wcsicmp(entry.szExeFile, image) == 0)
            ++count;
    }
    return count;
}

DWORD ProcessIdOf(const wchar_t *image)
{
    UniqueHandle snapshot(CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
    if (!snapshot)
        return 0;
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    for (BOOL more = Process32FirstW(snapshot.Get(), &entry); more; more = Process32NextW(snapshot.Get(), &entry))
        if (_wcsicmp(entry.szExeFile, image) == 0)
            return entry.th32ProcessID;
    return 0;
}

DWORD ServerProcessId()
{
    return ProcessIdOf(L"Local.exe");
}

DWORD NodeProcessId()
{
    // The machine's node is the one that serves its pipe: a test may run a
    // second node beside it, for another machine.
    for (int attempt = 0; attempt < 50; ++attempt) {
        UniqueHandle pipe(CreateFileW(L"\\\\.\\pipe\\CadroNode", GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                                      OPEN_EXISTING, 0, nullptr));
        if (pipe) {
            ULONG pid = 0;
            return GetNamedPipeServerProcessId(pipe.Get(), &pid) ? pid : 0;
        }
        if (GetLastError() != ERROR_PIPE_BUSY)
            return 0;
        WaitNamedPipeW(L"\\\\.\\pipe\\CadroNode", 100);
    }
    return 0;
}

namespace {
// Every test meets the network as its description says, as if the node had
// just started (it outlives the servers of earlier tests); the suite leaves
// no node behind.
class NodeReset : public testing::EmptyTestEventListener {
    void OnTestStart(const testing::TestInfo &) override
    {
        if (DWORD pid = NodeProcessId()) {
            std::string output;
            RunAndCapture(L"\"" + BinPath(L"cadroctl.exe") + L"\" --pid " + std::to_wstring(pid) + L" reset", output);
        }
    }
    void OnTestProgramEnd(const testing::UnitTest &) override
    {
        // A server still in its grace period would start a node again once
        // this one is gone: the servers go first.
        WaitForNoServerProcess(30000);
        CadroSim_StopNode();
    }
};

const bool g_nodeReset = [] {
    testing::UnitTest::GetInstance()->listeners().Append(new NodeReset);
    return true;
}();
} // namespace

long RunCadroctl(const std::wstring &arguments, std::string &output)
{
    // Without a node to name, cadroctl would reach this test program's own
    // network instead.
    DWORD pid = NodeProcessId();
    if (pid == 0) {
        output = "no network node runs";
        return -1;
    }
    return RunAndCapture(L"\"" + BinPath(L"cadroctl.exe") + L"\" --pid " + std::to_wstring(pid) + L" " + arguments,
                         output);
}

bool EnsureNode(DWORD timeoutMs)
{
    // The node that the last test program stopped may still answer the first
    // look and be gone the next moment: a node is started whenever none
    // answers (again every few seconds), as the servers' libraries start it;
    // one that loses the race for the pipe leaves by itself.
    const DWORD start = GetTickCount();
    DWORD lastStart = 0;
    bool started = false;
    do {
        if (NodeProcessId() != 0)
            return true;
        DWORD now = GetTickCount();
        if (!started || now - lastStart >= 3000) {
            UniqueHandle node(StartProcess(L"\"" + BinPath(L"cadronode.exe") + L"\""));
            started = true;
            lastStart = now;
        }
        Sleep(100);
    } while (GetTickCount() - start < timeoutMs);
    return false;
}

bool WaitForNoServerProcess(DWORD timeoutMs)
{
    return WaitForNoProcess(L"Local.exe", timeoutMs);
}

bool WaitForNoProcess(const wchar_t *image, DWORD timeoutMs)
{
    DWORD start = GetTickCount();
    while (CountProcesses(image) != 0) {
        if (GetTickCount() - start > timeoutMs)
            return false;
        Sleep(100);
    }
    return true;
}

std::wstring BinPath(const wchar_t *file)
{
    if (const char *dir = getenv("SKYLARC_BIN_DIR")) {
        // A Unix path from CTest: Wine maps it through drive Z:.
        std::string unix(dir);
        std::wstring path = L"Z:";
        for (char c : unix)
            path += c == '/' ? L'\\' : static_cast<wchar_t>(c);
        return path + L"\\" + file;
    }
    wchar_t self[MAX_PATH];
    GetModuleFileNameW(nullptr, self, MAX_PATH);
    std::wstring path(self);
    return path.substr(0, path.find_last_of(L'\\') + 1) + file;
}

HANDLE StartProcess(const std::wstring &commandLine)
{
    STARTUPINFOW si = {};
    si.cb = sizeof si;
    PROCESS_INFORMATION pi = {};
    std::wstring mutableLine = commandLine;
    if (!CreateProcessW(nullptr, mutableLine.data(), nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si, &pi))
        return nullptr;
    CloseHandle(pi.hThread);
    return pi.hProcess;
}

long RunAndWait(const std::wstring &commandLine, DWORD timeoutMs)
{
    UniqueHandle process(StartProcess(commandLine));
    if (!process)
        return -1;
    if (WaitForSingleObject(process.Get(), timeoutMs) != WAIT_OBJECT_0) {
        TerminateProcess(process.Get(), 1);
        WaitForSingleObject(process.Get(), 5000);
        return -1;
    }
    DWORD code = 0;
    GetExitCodeProcess(process.Get(), &code);
    return static_cast<long>(code);
}

bool KeyExists(HKEY root, const std::wstring &path)
{
    HKEY key;
    if (RegOpenKeyExW(root, path.c_str(), 0, KEY_READ, &key) != ERROR_SUCCESS)
        return false;
    RegCloseKey(key);
    return true;
}

std::wstring ReadString(HKEY root, const std::wstring &path, const wchar_t *name)
{
    wchar_t data[1024] = {};
    DWORD size = sizeof data;
    if (RegGetValueW(root, path.c_str(), name, RRF_RT_REG_SZ, nullptr, data, &size) != ERROR_SUCCESS)
        return L"<missing>";
    return data;
}
