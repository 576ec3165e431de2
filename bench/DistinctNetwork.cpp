#include "DistinctNetwork.h"

#include "CadroSim.h"
#include "Handle.h"

#include <tlhelp32.h>

#include <algorithm>
#include <string>

namespace {
constexpr DWORD kObjects = 100;

std::wstring Id(DWORD i, const wchar_t *kind)
{
    return L"\\\\.\\plant\\U" + std::to_wstring(i % kObjects) + L"." + kind + std::to_wstring(i / kObjects);
}

// The ids of members first .. first + n - 1 of a kind ("c" counting, "k"
// constant).
std::vector<std::wstring> Ids(DWORD first, DWORD n, const wchar_t *kind)
{
    std::vector<std::wstring> ids;
    for (DWORD i = first; i < first + n; ++i)
        ids.push_back(Id(i, kind));
    return ids;
}

std::string Description(DWORD members)
{
    std::string text = "machine $HOST\nprocess plant\n";
    for (DWORD o = 0; o < kObjects; ++o) {
        text += "object U" + std::to_string(o) + "\n";
        for (DWORD i = 0; i * kObjects + o < members; ++i) {
            text += "member c" + std::to_string(i) + " source=counter period=10\n";
            text += "member k" + std::to_string(i) + " value=" + std::to_string(i % 97) + "\n";
        }
    }
    return text;
}

HRESULT Execute(const std::wstring &command, std::wstring &answer)
{
    BSTR text = nullptr;
    HRESULT hr = CadroSim_Execute(command.c_str(), &text);
    answer = text ? text : L"";
    SysFreeString(text);
    return hr;
}
} // namespace

DistinctNetwork::DistinctNetwork(DWORD members) : m_members(members)
{
    std::wstring path = BesideThisProgram(L"distinct_network.txt");
    if (!WriteTextFile(path, Description(members))) {
        m_error = L"cannot write " + path;
        return;
    }
    std::wstring answer;
    if (Execute(L"load \"" + path + L"\"", answer) != S_OK) {
        m_error = L"the network node did not take the description: " + answer;
        return;
    }
    m_loaded = true;
}

DistinctNetwork::~DistinctNetwork()
{
    std::wstring answer;
    if (m_loaded)
        Execute(L"reset", answer);
}

std::vector<std::wstring> DistinctNetwork::Changing(DWORD n) const
{
    return DistinctChangingIds(0, std::min(n, m_members));
}

std::vector<std::wstring> DistinctNetwork::Constant(DWORD n) const
{
    return Ids(0, std::min(n, m_members), L"k");
}

std::vector<std::wstring> DistinctChangingIds(DWORD first, DWORD n)
{
    return Ids(first, n, L"c");
}

HANDLE OpenProcessNamed(const wchar_t *image)
{
    UniqueHandle snapshot(CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0));
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    for (BOOL more = Process32FirstW(snapshot.Get(), &entry); more; more = Process32NextW(snapshot.Get(), &entry))
        if (_wcsicmp(entry.szExeFile, image) == 0)
            return OpenProcess(PROCESS_QUERY_INFORMATION | PROCESS_VM_READ, FALSE, entry.th32ProcessID);
    return nullptr;
}

std::wstring BesideThisProgram(const wchar_t *file)
{
    wchar_t self[MAX_PATH];
    GetModuleFileNameW(nullptr, self, MAX_PATH);
    std::wstring path(self);
    return path.substr(0, path.find_last_of(L'\\') + 1) + file;
}

bool WriteTextFile(const std::wstring &path, const std::string &text)
{
    UniqueHandle file(CreateFileW(path.c_str(), GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr));
    DWORD written = 0;
    return file && WriteFile(file.Get(), text.data(), static_cast<DWORD>(text.size()), &written, nullptr) &&
           written == text.size();
}
