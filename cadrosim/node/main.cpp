// cadronode: the simulated Cadro network as a process of its own. The
// libraries of server processes connect to it over its pipe and start it
// when none runs; it keeps values, writes and added members for as long as
// it runs, and ends on "cadroctl shutdown" or after an idle time.
#include "CadroSim.h"

#include <windows.h>

#include <cstdio>
#include <cwchar>
#include <string>

namespace {
constexpr unsigned long kDefaultIdleSeconds = 300;

// Registry value "Node Idle Seconds" of HKLM\Software\Tarnwell\Cadro
// Simulator, else the default.
unsigned long ConfiguredIdleSeconds()
{
    DWORD seconds = 0;
    DWORD size = sizeof seconds;
    if (RegGetValueW(HKEY_LOCAL_MACHINE, L"Software\\Tarnwell\\Cadro Simulator", L"Node Idle Seconds", RRF_RT_REG_DWORD,
                     nullptr, &seconds, &size) == ERROR_SUCCESS &&
        seconds > 0)
        return seconds;
    return kDefaultIdleSeconds;
}
} // namespace

// A pipe's name: letters, digits, "-" and "_".
bool GoodName(const std::wstring &name)
{
    return !name.empty() && name.size() <= 64 &&
           name.find_first_not_of(L"abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-_") ==
               std::wstring::npos;
}

int wmain(int argc, wchar_t **argv)
{
    unsigned long idle = ConfiguredIdleSeconds();
    const wchar_t *name = nullptr;
    const wchar_t *listen = nullptr;
    for (int i = 1; i < argc; ++i) {
        std::wstring arg = argv[i];
        if (arg == L"--network" && i + 1 < argc) {
            // Read by the engine when it starts, as if it were configured.
            SetEnvironmentVariableW(L"CADRO_NETWORK_FILE", argv[++i]);
        } else if (arg == L"--listen" && i + 1 < argc) {
            listen = argv[++i];
        } else if (arg == L"--name" && i + 1 < argc) {
            name = argv[++i];
            if (!GoodName(name)) {
                fwprintf(stderr, L"cadronode: --name takes letters, digits, '-' and '_'\n");
                return 2;
            }
        } else if (arg == L"--idle" && i + 1 < argc) {
            wchar_t *end = nullptr;
            idle = wcstoul(argv[++i], &end, 10);
            if (*end || idle == 0) {
                fwprintf(stderr, L"cadronode: --idle takes a number of seconds above 0\n");
                return 2;
            }
        } else {
            fwprintf(
                stderr,
                L"usage: cadronode [--idle <seconds>] [--network <file>] [--listen [<host>:]<port>] [--name <name>]\n\n"
                L"Serves the simulated Cadro network (the built-in default, or the file named by\n"
                L"CADRO_NETWORK_FILE or the registry value \"Network File\") to the servers of this\n"
                L"machine. Servers start it when none runs; it ends on 'cadroctl shutdown' or when\n"
                L"nothing has been connected for the idle time (default %lu s, or the registry\n"
                L"value \"Node Idle Seconds\").\n\n"
                L"--network serves that description file (instead of the configured one)\n"
                L"--listen  also serves its machines to the nodes of other machines over TCP (a\n"
                L"          port alone listens on the loopback address only; 0.0.0.0:<port> on all)\n"
                L"--name    the node's pipe name instead of CadroNode: a second node on one machine,\n"
                L"          which this machine's servers do not use (for trying two machines out)\n",
                kDefaultIdleSeconds);
            return arg == L"--help" || arg == L"-h" ? 0 : 2;
        }
    }
    return CadroSim_RunNode(idle, name, listen);
}
