#include "TestNetwork.h"

#include "Handle.h"
#include "ServerProcess.h"

TestNetwork::TestNetwork(const wchar_t *fileName, const std::string &text) : m_path(BinPath(fileName))
{
    UniqueHandle file(CreateFileW(m_path.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr));
    DWORD written = 0;
    m_ok = file && WriteFile(file.Get(), text.data(), static_cast<DWORD>(text.size()), &written, nullptr);
}

TestNetwork::~TestNetwork()
{
    std::string output;
    if (m_loaded)
        RunCadroctl(L"reset", output);
    DeleteFileW(m_path.c_str());
}

long TestNetwork::Load()
{
    // Each test program stops the node at its end: the next one may find
    // none until a server needs the network.
    std::string output;
    long code = -1;
    for (int i = 0; i < 100 && code != 0; ++i, Sleep(100)) {
        // Asked again at each try: the node found first may have been
        // leaving.
        if (!EnsureNode(20000))
            return -1;
        code = RunCadroctl(L"load \"" + m_path + L"\"", output);
    }
    m_loaded = true;
    return code;
}
