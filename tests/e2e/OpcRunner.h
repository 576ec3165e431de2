#pragma once
// Runs the opc client of the build for end-to-end tests.
#include <windows.h>

#include <string>
#include <vector>

struct OpcRun {
    long code;          // -1: it did not end within the time limit and was killed
    std::string output; // standard output and standard error together
};

OpcRun Opc(const std::string &arguments, DWORD timeoutMs = 60000);

// The non-empty lines of text.
std::vector<std::string> Lines(const std::string &text);

inline bool Has(const std::string &text, const std::string &part)
{
    return text.find(part) != std::string::npos;
}
