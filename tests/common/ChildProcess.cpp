#include "ChildProcess.h"

#include "Handle.h"

long RunAndCapture(const std::wstring &commandLine, std::string &output, DWORD timeoutMs)
{
    SECURITY_ATTRIBUTES sa = {sizeof sa, nullptr, TRUE};
    HANDLE readEnd = nullptr, writeEnd = nullptr;
    if (!CreatePipe(&readEnd, &writeEnd, &sa, 0))
        return -1;
    UniqueHandle reader(readEnd), writer(writeEnd);
    SetHandleInformation(readEnd, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW si = {};
    si.cb = sizeof si;
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdOutput = writeEnd;
    si.hStdError = writeEnd;
    PROCESS_INFORMATION pi = {};
    // Under a heavily loaded Wine a process start can fail now and then:
    // tried a few times, and a last failure says its code in the output.
    bool started = false;
    for (int attempt = 0; attempt < 3 && !started; ++attempt) {
        std::wstring line = commandLine;
        started = CreateProcessW(nullptr, line.data(), nullptr, nullptr, TRUE, 0, nullptr, nullptr, &si, &pi) != FALSE;
        if (!started) {
            output = "CreateProcess failed: error " + std::to_string(GetLastError());
            Sleep(200);
        }
    }
    if (!started)
        return -1;
    UniqueHandle process(pi.hProcess), thread(pi.hThread);
    writer.Reset();
    output.clear();
    // Reads while the program runs; one that outlives the time limit is ended.
    DWORD start = GetTickCount();
    char buffer[4096];
    for (;;) {
        DWORD available = 0, got = 0;
        bool open = PeekNamedPipe(readEnd, nullptr, 0, nullptr, &available, nullptr) != FALSE;
        if (open && available > 0) {
            if (ReadFile(readEnd, buffer, sizeof buffer, &got, nullptr) && got)
                output.append(buffer, got);
            continue;
        }
        bool ended = WaitForSingleObject(process.Get(), open ? 20 : 0) == WAIT_OBJECT_0;
        if (!open || (ended && (!PeekNamedPipe(readEnd, nullptr, 0, nullptr, &available, nullptr) || !available)))
            break;
        if (GetTickCount() - start > timeoutMs) {
            TerminateProcess(process.Get(), 1);
            WaitForSingleObject(process.Get(), 5000);
            return -1;
        }
    }
    if (WaitForSingleObject(process.Get(), timeoutMs) != WAIT_OBJECT_0)
        return -1;
    DWORD code = 0;
    GetExitCodeProcess(process.Get(), &code);
    return static_cast<long>(code);
}
