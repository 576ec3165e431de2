#pragma once
// A network description of a test's own, in a file beside the programs:
// loaded into the machine's network node while it lives, which then goes
// back to its configured description.
#include <string>

class TestNetwork {
public:
    TestNetwork(const wchar_t *fileName, const std::string &text);
    ~TestNetwork();
    TestNetwork(const TestNetwork &) = delete;
    TestNetwork &operator=(const TestNetwork &) = delete;

    bool Ok() const { return m_ok; }
    const std::wstring &Path() const { return m_path; }
    // Into the machine's node, which a server has started (or is starting):
    // cadroctl's exit code.
    long Load();

private:
    std::wstring m_path;
    bool m_ok = false;
    bool m_loaded = false;
};
