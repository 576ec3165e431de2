#include "BaselineProcess.h"

#include <string>

namespace {
std::string ReadLine(HANDLE pipe)
{
    std::string line;
    char c;
    DWORD got;
    while (ReadFile(pipe, &c, 1, &got, nullptr) && got == 1 && c != '\n')
        line += c;
    return line;
}
} // namespace

BaselineProcess::BaselineProcess(DWORD n, bool singleThreaded)
{
    wchar_t exe[MAX_PATH];
    GetModuleFileNameW(nullptr, exe, MAX_PATH);
    std::wstring path(exe);
    path = path.substr(0, path.find_last_of(L"\\/") + 1) + L"baseline_server.exe";
    std::wstring command = L"\"" + path + L"\" " + std::to_wstring(n) + L" " + std::to_wstring(GetCurrentProcessId()) +
                           (singleThreaded ? L" sta" : L"");

    SECURITY_ATTRIBUTES inherit = {sizeof(inherit), nullptr, TRUE};
    HANDLE readEnd = nullptr, writeEnd = nullptr;
    if (!CreatePipe(&readEnd, &writeEnd, &inherit, 0))
        return;
    UniqueHandle reader(readEnd), writer(writeEnd);
    SetHandleInformation(readEnd, HANDLE_FLAG_INHERIT, 0);
    STARTUPINFOW si = {};
    si.cb = sizeof(si);
    si.dwFlags = STARTF_USESTDHANDLES;
    si.hStdOutput = writeEnd;
    si.hStdError = GetStdHandle(STD_ERROR_HANDLE);
    PROCESS_INFORMATION pi = {};
    if (!CreateProcessW(nullptr, &command[0], nullptr, nullptr, TRUE, 0, nullptr, nullptr, &si, &pi))
        return;
    m_process.Reset(pi.hProcess);
    UniqueHandle thread(pi.hThread);
    writer.Reset();
    Unmarshal(ReadLine(reader.Get()));
}

BaselineProcess::~BaselineProcess()
{
    m_object.Reset(); // the baseline ends once it is released
    if (m_process)
        WaitForSingleObject(m_process.Get(), 10000);
}

// The object, marshalled by the baseline as hex.
void BaselineProcess::Unmarshal(const std::string &hex)
{
    HGLOBAL memory = GlobalAlloc(GMEM_MOVEABLE, hex.size() / 2 + 1);
    if (!memory)
        return;
    auto *bytes = static_cast<unsigned char *>(GlobalLock(memory));
    for (size_t i = 0; i + 1 < hex.size(); i += 2)
        bytes[i / 2] = static_cast<unsigned char>(std::stoul(hex.substr(i, 2), nullptr, 16));
    GlobalUnlock(memory);
    ComPtr<IStream> stream;
    if (FAILED(CreateStreamOnHGlobal(memory, TRUE, stream.Out()))) {
        GlobalFree(memory);
        return;
    }
    CoUnmarshalInterface(stream.Get(), IID_IUnknown, reinterpret_cast<void **>(m_object.Out()));
}
