// opc: a command-line OPC Data Access client. It lists the OPC servers of
// this machine and browses, reads, writes and subscribes to the items of one.
#include "Commands.h"

#include <objbase.h>
#include <shellapi.h>

#include <cstdio>

namespace {
struct Command {
    const wchar_t *name;
    const wchar_t *summary;
    const wchar_t *usage; // what follows "opc <name>" and the options
    std::vector<std::wstring> options;
    int (*run)(const Arguments &, Output &, Connection &);
    bool (*check)(const Arguments &, Output &); // before the server is started
};

int RunListServers(const Arguments &args, Output &out, Connection &)
{
    return ListServers(args, out);
}

const wchar_t kCommonOptions[] =
    L"  -s, --server NAME   the server's ProgID or {CLSID} (default Tarnwell.SkylarcOPCServer)\n"
    L"  -j, --json          one JSON object per line, for scripts\n"
    L"  -t, --timeout SECONDS  how long to wait for the server to answer (default 30)\n"
    L"  -h, --help          this text\n";

const Command kCommands[] = {
    {L"servers",
     L"list the OPC Data Access servers registered on a machine",
     L" [--host NAME]\n\n"
     L"Lists every class of the OPC DA 1.0 and 2.0 component categories, and every ProgID\n"
     L"that carries an OPC key: ProgID, versions, vendor, CLSID and description. They are\n"
     L"asked of the machine's OPC server list (OPC.ServerList) when one is registered;\n"
     L"without one, this machine's registry is read.\n"
     L"  --host NAME         the machine to ask (default this one); the vendor is only\n"
     L"                      known for this machine\n",
     {L"host"},
     RunListServers,
     nullptr},
    {L"status",
     L"show a server's status",
     L"\n\nPrints the server's state, start time, current time, last update time, group\n"
     L"count, version and vendor.\n",
     {},
     ShowStatus,
     CheckStatus},
    {L"browse",
     L"browse a server's address space",
     L" [BRANCH] [--flat] [--depth N] [--filter PATTERN] [--type TYPE] [--access read|write]\n"
     L"              [--details]\n\n"
     L"Prints the tree of branches and items below BRANCH (the root when absent),\n"
     L"indented, with each item's identifier. BRANCH is either an item identifier of a\n"
     L"branch (\\\\MACHINE\\process\\object) or the names to descend, separated by '/'.\n"
     L"  --flat              every item identifier below BRANCH, one per line\n"
     L"  --depth N           descend at most N levels (1: the branch's own contents)\n"
     L"  --filter PATTERN    only items whose names match PATTERN (* ? # [ ])\n"
     L"  --type TYPE         only items whose value converts to TYPE\n"
     L"  --access MODE       only items that can be read, or written\n"
     L"  --details           each item's canonical type and access rights\n",
     {L"flat", L"depth", L"filter", L"type", L"access", L"details"},
     Browse,
     CheckBrowse},
    {L"read",
     L"read items once",
     L" ITEM... [--source cache|device] [--type TYPE]\n\n"
     L"Reads each item: value, type, quality and time stamp (local time, ISO 8601).\n"
     L"  --source SOURCE     cache (default) or device\n"
     L"  --type TYPE         the type to ask for (bool, int8..int64, uint8..uint64, float,\n"
     L"                      double, currency, date, string; VT_ names too)\n",
     {L"source", L"type"},
     ReadItems,
     CheckRead},
    {L"write",
     L"write values to items",
     L" ITEM VALUE [ITEM VALUE...] [--type TYPE]\n\n"
     L"Writes each VALUE, converted to the item's own type (or to TYPE) in the\n"
     L"invariant format: a point for decimals, true or false for booleans.\n"
     L"  --type TYPE         the type to send the values as\n",
     {L"type"},
     WriteItems,
     CheckWrite},
    {L"subscribe",
     L"print the changes of items as they arrive",
     L" ITEM... [--rate MS] [--duration SECONDS] [--count N] [--deadband PERCENT]\n"
     L"              [--type TYPE] [--da1]\n\n"
     L"Adds the items to an active group and prints every change the server sends,\n"
     L"until interrupted (Ctrl+C), for a duration, or for a number of changes.\n"
     L"  --rate MS           the group's update rate (default 1000)\n"
     L"  --duration SECONDS  stop after this time\n"
     L"  --count N           stop after N changes\n"
     L"  --deadband PERCENT  the group's percent deadband\n"
     L"  --type TYPE         the type to ask for\n"
     L"  --da1               receive OPC DA 1.0 data streams (IDataObject) instead of\n"
     L"                      DA 2.0 callbacks (IOPCDataCallback)\n",
     {L"rate", L"duration", L"count", L"deadband", L"type", L"da1"},
     Subscribe,
     CheckSubscribe},
    {L"properties",
     L"list the properties of items",
     L" ITEM...\n\nPrints each property's id, description, type and value.\n",
     {},
     ShowProperties,
     CheckProperties},
};

void PrintUsage(Output &out)
{
    std::wstring text = L"usage: opc COMMAND [ARGUMENTS] [OPTIONS]\n\n"
                        L"A command-line client for OPC Data Access servers.\n\nCommands:\n";
    for (const Command &c : kCommands) {
        wchar_t line[160];
        swprintf(line, 160, L"  %-12ls %ls\n", c.name, c.summary);
        text += line;
    }
    text += L"\nOptions of every command:\n";
    text += kCommonOptions;
    text += L"\n'opc COMMAND --help' describes a command.\n\n"
            L"Exit codes: 0 success, 1 an operation or an item failed, 2 wrong usage,\n"
            L"3 the server is not registered, cannot be reached or does not answer in time.";
    out.Line(text);
}

void PrintHelp(const Command &c, Output &out)
{
    out.Line(std::wstring(L"usage: opc ") + c.name + c.usage + L"\nOptions of every command:\n" + kCommonOptions);
}

std::vector<std::wstring> WideArguments()
{
    int argc = 0;
    LPWSTR *argv = CommandLineToArgvW(GetCommandLineW(), &argc);
    std::vector<std::wstring> args;
    for (int i = 1; argv && i < argc; ++i)
        args.emplace_back(argv[i]);
    LocalFree(argv);
    return args;
}

int Run()
{
    Arguments args;
    std::wstring error;
    bool parsed = args.Parse(WideArguments(), error);
    Output out(args.Has(L"json"));
    if (!parsed) {
        out.Error(error);
        return kExitUsage;
    }
    if (args.Command().empty() || args.Command() == L"help") {
        PrintUsage(out);
        return args.Command().empty() && !args.Has(L"help") ? kExitUsage : kExitOk;
    }
    for (const Command &c : kCommands) {
        if (args.Command() != c.name)
            continue;
        if (args.Has(L"help")) {
            PrintHelp(c, out);
            return kExitOk;
        }
        std::vector<std::wstring> known = c.options;
        known.insert(known.end(), {L"server", L"json", L"help", L"timeout"});
        std::wstring unknown = args.Unknown(known);
        if (!unknown.empty()) {
            out.Error(L"unknown option " + unknown + L" of " + c.name + L" (see opc " + c.name + L" --help)");
            return kExitUsage;
        }
        if (c.check && !c.check(args, out))
            return kExitUsage;
        double timeout = kDefaultTimeoutSeconds;
        if (args.Has(L"timeout") && !ParseNumber(args.Value(L"timeout"), 1, 86400, timeout)) {
            out.Error(L"--timeout takes a number of seconds from 1 to 86400");
            return kExitUsage;
        }
        Connection server;
        if (c.run != RunListServers) {
            int opened = server.Open(args.Value(L"server", Connection::kDefaultServer), timeout, out);
            if (opened != kExitOk)
                return opened;
        }
        return c.run(args, out, server);
    }
    out.Error(L"unknown command \"" + args.Command() + L"\" (see opc --help)");
    return kExitUsage;
}
} // namespace

int wmain()
{
    SetConsoleOutputCP(CP_UTF8);
    if (FAILED(CoInitializeEx(nullptr, COINIT_MULTITHREADED)))
        return kExitFailed;
    // Calls into this process (callbacks) need no particular identity.
    CoInitializeSecurity(nullptr, -1, nullptr, nullptr, RPC_C_AUTHN_LEVEL_NONE, RPC_C_IMP_LEVEL_IDENTIFY, nullptr,
                         EOAC_NONE, nullptr);
    int code = Run();
    if (Connection::CreationAbandoned()) {
        // A creation is still waiting for a server that does not answer:
        // COM's cleanup would wait with it.
        fflush(stdout);
        fflush(stderr);
        TerminateProcess(GetCurrentProcess(), static_cast<UINT>(code));
    }
    CoUninitialize();
    return code;
}
