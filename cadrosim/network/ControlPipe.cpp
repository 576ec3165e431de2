#include "CadroSim.h"
#include "Engine.h"
#include "ThreadName.h"

namespace cadrosim {

namespace {
constexpr DWORD kBufferBytes = 1 << 20;

// Waits for an overlapped operation or the stop event; false when stopping.
bool Await(HANDLE pipe, OVERLAPPED &ov, HANDLE stop, DWORD &bytes)
{
    HANDLE events[] = {ov.hEvent, stop};
    if (WaitForMultipleObjects(2, events, FALSE, INFINITE) != WAIT_OBJECT_0) {
        CancelIo(pipe);
        GetOverlappedResult(pipe, &ov, &bytes, TRUE);
        return false;
    }
    return GetOverlappedResult(pipe, &ov, &bytes, FALSE) != FALSE;
}
} // namespace

ControlPipe::ControlPipe(Engine &engine) : m_engine(engine), m_stop(CreateEventW(nullptr, TRUE, FALSE, nullptr))
{
    m_thread = NamedThread(L"control pipe", [this] { Run(); });
}

ControlPipe::~ControlPipe()
{
    SetEvent(m_stop);
    if (m_thread.joinable())
        m_thread.join();
    CloseHandle(m_stop);
}

void ControlPipe::Run()
{
    std::wstring name = ControlPipeName(GetCurrentProcessId());
    std::vector<wchar_t> buffer(kBufferBytes / sizeof(wchar_t));
    HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    auto newInstance = [&name] {
        return CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                                PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, PIPE_UNLIMITED_INSTANCES,
                                kBufferBytes, kBufferBytes, 0, nullptr);
    };
    HANDLE pipe = newInstance();
    while (pipe != INVALID_HANDLE_VALUE && WaitForSingleObject(m_stop, 0) == WAIT_TIMEOUT) {
        OVERLAPPED ov = {};
        ov.hEvent = event;
        ResetEvent(event);
        DWORD bytes = 0;
        bool connected = ConnectNamedPipe(pipe, &ov) ? true : GetLastError() == ERROR_PIPE_CONNECTED;
        if (!connected && GetLastError() == ERROR_IO_PENDING)
            connected = Await(pipe, ov, m_stop, bytes);
        // The next caller finds an instance while this one is served: a
        // moment without one would tell it that no network runs here.
        HANDLE next = newInstance();
        if (connected) {
            ResetEvent(event);
            bool read = ReadFile(pipe, buffer.data(), kBufferBytes - sizeof(wchar_t), &bytes, &ov) ||
                        (GetLastError() == ERROR_IO_PENDING && Await(pipe, ov, m_stop, bytes));
            if (read) {
                std::wstring answer = m_engine.Execute(std::wstring(buffer.data(), bytes / sizeof(wchar_t)));
                DWORD size = static_cast<DWORD>(std::min<size_t>(answer.size() * sizeof(wchar_t), kBufferBytes));
                ResetEvent(event);
                if (!WriteFile(pipe, answer.data(), size, &bytes, &ov) && GetLastError() == ERROR_IO_PENDING)
                    Await(pipe, ov, m_stop, bytes);
                FlushFileBuffers(pipe);
            }
            DisconnectNamedPipe(pipe);
        }
        CloseHandle(pipe);
        // An instance that could not be made while this one was served (a
        // served one that its caller still holds counts against the limit,
        // a moment of shortage) is made now: without one, the process would
        // look from then on as if it ran no network.
        while (next == INVALID_HANDLE_VALUE && WaitForSingleObject(m_stop, 50) == WAIT_TIMEOUT)
            next = newInstance();
        pipe = next;
    }
    if (pipe != INVALID_HANDLE_VALUE)
        CloseHandle(pipe);
    CloseHandle(event);
}

} // namespace cadrosim
