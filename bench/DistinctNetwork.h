#pragma once
// A plant's items for the benchmarks: N distinct members that count every
// 10 ms and N constant ones, over 100 objects, loaded into the network node
// (started when none runs) for the life of the object; the node goes back to
// its configured description afterwards. The server must not be running
// before: a running one serves the network it found.
#include <windows.h>

#include <string>
#include <vector>

class DistinctNetwork {
public:
    explicit DistinctNetwork(DWORD members);
    ~DistinctNetwork();
    DistinctNetwork(const DistinctNetwork &) = delete;
    DistinctNetwork &operator=(const DistinctNetwork &) = delete;

    // Empty when it was loaded, else what went wrong.
    const std::wstring &Error() const { return m_error; }
    // The first n of the counting members' and of the constant members' ids.
    std::vector<std::wstring> Changing(DWORD n) const;
    std::vector<std::wstring> Constant(DWORD n) const;

private:
    DWORD m_members;
    std::wstring m_error;
    bool m_loaded = false;
};

// The ids of the counting members first .. first + n - 1 of a distinct
// network, for a process that did not load it (a benchmark's client).
std::vector<std::wstring> DistinctChangingIds(DWORD first, DWORD n);

// A process of the given image name, opened to read its times and memory.
HANDLE OpenProcessNamed(const wchar_t *image);
// A file in this program's folder, and writing one.
std::wstring BesideThisProgram(const wchar_t *file);
bool WriteTextFile(const std::wstring &path, const std::string &text);
