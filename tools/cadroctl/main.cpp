// cadroctl: drives the simulated Cadro network of running programs (the
// network node, tests) through their control pipes: publish values, change
// the topology, inject faults, look at subscriptions.
#include "CadroSim.h"

#include <tlhelp32.h>

#include <cstdio>
#include <cwchar>
#include <string>
#include <vector>

namespace {
struct Help {
    const wchar_t *command;
    const wchar_t *usage;
    const wchar_t *text;
};

const Help kHelp[] = {
    {L"publish", L"publish <url> <value> [quality=good|bad] [time=now|<YYYY-MM-DDTHH:MM:SS[.mmm]Z>|<FILETIME>]",
     L"Publishes a value on a data member as its Skylarc process would; every subscriber receives it.\n"
     L"  The value is read in the member's type (true/false, a number, text). A bad quality sets the\n"
     L"  network's error flag. Example: cadroctl publish \\\\.\\proc1\\Setpoints.temperature 22.5"},
    {L"add-member",
     L"add-member <object url> <name> [type=bool|number|text|wtext|none] [access=r|w|rw]\n"
     L"           [source=const|sine|cosine|ramp|square|random|counter|toggle] [period=<ms>] [value=<v>]",
     L"Adds a data member (and its object path) to a process; browsers are told that the network changed."},
    {L"remove-member", L"remove-member <url>",
     L"Removes a data member; its subscribers get status 18 and no more values."},
    {L"disconnect", L"disconnect <machine>",
     L"Disconnects a machine: its subscriptions get status 15 and no values until reconnect."},
    {L"reconnect", L"reconnect <machine>",
     L"Reconnects a machine: its subscriptions get status 13, 14, 16, 17, attributes, then values again."},
    {L"stall", L"stall <url>", L"Stalls a data member: it delivers no more values."},
    {L"unstall", L"unstall <url>", L"Lets a stalled data member deliver values again."},
    {L"show", L"show <url>", L"Shows a data member: type, access, value, quality, time, subscribers."},
    {L"browse", L"browse <url>", L"Lists the children of \\ (the machines), a machine, a process or an object."},
    {L"list-subscriptions", L"list-subscriptions", L"Lists the data members that have subscribers, with counts."},
    {L"status", L"status", L"Shows the host, the network description in use and the machines' connections."},
    {L"reset", L"reset", L"Loads the network's description again: values, members and connections as described."},
    {L"load", L"load <file>",
     L"Replaces the network with the one a description file gives (subscriptions keep their old\n"
     L"  members until they subscribe again); 'reset' goes back to the configured description."},
    {L"shutdown", L"shutdown",
     L"Ends the network node (cadronode). Servers see their subscriptions disconnected; the next one\n"
     L"  that needs the network starts a new node."},
};

void PrintUsage()
{
    wprintf(L"usage: cadroctl [--pid <process id>] <command> [arguments]\n\n"
            L"Drives the simulated Cadro network of every running program that serves one (the\n"
            L"network node cadronode among them) through its control pipe, or of one process with --pid.\n\n"
            L"commands:\n");
    for (const Help &h : kHelp)
        wprintf(L"  %ls\n", h.usage);
    wprintf(L"\nURLs name members as \\\\machine\\process\\object[\\object...].member; \\\\. is this machine.\n"
            L"'cadroctl <command> --help' describes one command. Exit code: 0 done, 1 refused, 2 no network.\n");
}

bool PrintCommandHelp(const std::wstring &command)
{
    for (const Help &h : kHelp) {
        if (command == h.command) {
            wprintf(L"usage: cadroctl [--pid <process id>] %ls\n\n%ls\n", h.usage, h.text);
            return true;
        }
    }
    return false;
}

std::vector<DWORD> ProcessIds()
{
    std::vector<DWORD> ids;
    HANDLE snapshot = CreateToolhelp32Snapshot(TH32CS_SNAPPROCESS, 0);
    if (snapshot == INVALID_HANDLE_VALUE)
        return ids;
    PROCESSENTRY32W entry = {};
    entry.dwSize = sizeof entry;
    for (BOOL more = Process32FirstW(snapshot, &entry); more; more = Process32NextW(snapshot, &entry))
        if (entry.th32ProcessID != GetCurrentProcessId())
            ids.push_back(entry.th32ProcessID);
    CloseHandle(snapshot);
    return ids;
}

// Sends the command to one engine; false when that process serves none.
bool Send(DWORD pid, const std::wstring &command, std::wstring &answer)
{
    std::vector<wchar_t> buffer(1 << 19);
    DWORD got = 0;
    std::wstring name = ControlPipeName(pid);
    for (int attempt = 0; attempt < 50; ++attempt) {
        if (CallNamedPipeW(name.c_str(), const_cast<wchar_t *>(command.data()),
                           static_cast<DWORD>(command.size() * sizeof(wchar_t)), buffer.data(),
                           static_cast<DWORD>(buffer.size() * sizeof(wchar_t)), &got, 2000)) {
            answer.assign(buffer.data(), got / sizeof(wchar_t));
            return true;
        }
        if (GetLastError() == ERROR_FILE_NOT_FOUND)
            return false;
        Sleep(20); // the single pipe instance is busy with another caller
    }
    return false;
}

std::wstring Quote(const std::wstring &arg)
{
    return arg.find_first_of(L" \t") == std::wstring::npos ? arg : L"\"" + arg + L"\"";
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    std::vector<std::wstring> args(argv + 1, argv + argc);
    DWORD onlyPid = 0;
    if (args.size() >= 2 && args[0] == L"--pid") {
        onlyPid = static_cast<DWORD>(wcstoul(args[1].c_str(), nullptr, 10));
        args.erase(args.begin(), args.begin() + 2);
    }
    if (args.empty() || args[0] == L"--help" || args[0] == L"-h" || args[0] == L"help") {
        PrintUsage();
        return args.empty() ? 1 : 0;
    }
    if (args.size() >= 2 && (args[1] == L"--help" || args[1] == L"-h")) {
        if (PrintCommandHelp(args[0]))
            return 0;
        fwprintf(stderr, L"cadroctl: unknown command '%ls'\n", args[0].c_str());
        return 1;
    }
    std::wstring command;
    for (const auto &a : args)
        command += (command.empty() ? L"" : L" ") + Quote(a);

    std::vector<DWORD> pids = onlyPid ? std::vector<DWORD>{onlyPid} : ProcessIds();
    int reached = 0, refused = 0;
    for (DWORD pid : pids) {
        std::wstring answer;
        if (!Send(pid, command, answer))
            continue;
        ++reached;
        bool ok = answer.compare(0, 2, L"ok") == 0;
        refused += ok ? 0 : 1;
        std::wstring body =
            ok ? answer.substr(answer.find(L'\n') == std::wstring::npos ? answer.size() : answer.find(L'\n') + 1)
               : answer;
        if (pids.size() > 1 && !body.empty())
            wprintf(L"[process %lu]\n", static_cast<unsigned long>(pid));
        fputws(body.c_str(), ok ? stdout : stderr);
    }
    if (reached == 0) {
        fwprintf(stderr, L"cadroctl: no running Cadro network found%ls\n", onlyPid ? L" in that process" : L"");
        return 2;
    }
    return refused ? 1 : 0;
}
