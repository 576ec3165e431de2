#include "OpcRunner.h"

#include "ServerProcess.h"

#include <sstream>

OpcRun Opc(const std::string &arguments, DWORD timeoutMs)
{
    OpcRun run;
    std::wstring wide(arguments.begin(), arguments.end());
    run.code = RunAndCapture(L"\"" + BinPath(L"opc.exe") + L"\" " + wide, run.output, timeoutMs);
    return run;
}

std::vector<std::string> Lines(const std::string &text)
{
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        if (!line.empty() && line.back() == '\r')
            line.pop_back();
        if (!line.empty())
            lines.push_back(line);
    }
    return lines;
}
