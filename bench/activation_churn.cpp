// activation_churn: many client processes connecting to the server at nearly
// the same time, round after round, while the server process starts, serves,
// stops and starts again between rounds.
//
//   activation_churn [clients] [rounds]      (default 8 clients, 50 rounds)
//
// Each round starts the clients (activation_client.exe, beside this program)
// within a random spread of up to a second; each creates the server, reads
// an item and releases it. Between rounds it pauses: not at all, briefly,
// about as long as an idle server waits before it stops (so that clients
// arrive while it revokes its class object and drains), or long enough for
// the server to have exited. It prints, per round and in total, the failed
// activations, the clients that hung (no end within a minute), the longest
// activation, and the server processes left 30 s after the last round.
// The server must be registered and no other server process running.
#include "ChildProcess.h"
#include "Handle.h"
#include "ServerProcesses.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <thread>
#include <vector>

namespace {
constexpr DWORD kClientTimeoutMs = 60000;

std::wstring BesideMe(const wchar_t *file)
{
    wchar_t self[MAX_PATH];
    GetModuleFileNameW(nullptr, self, MAX_PATH);
    std::wstring path(self);
    return path.substr(0, path.find_last_of(L'\\') + 1) + file;
}

struct Totals {
    int started = 0, failed = 0, hung = 0;
    unsigned long long longestMs = 0;
};

void RunRound(int round, int clients, std::mt19937 &random, Totals &totals)
{
    std::wstring eventName =
        L"activation_churn_" + std::to_wstring(GetCurrentProcessId()) + L"_" + std::to_wstring(round);
    UniqueHandle go(CreateEventW(nullptr, TRUE, FALSE, eventName.c_str()));
    std::uniform_int_distribution<int> spread(0, 999);
    std::vector<std::string> outputs(clients);
    std::vector<long> codes(clients, 0);
    std::vector<std::thread> runners;
    for (int i = 0; i < clients; ++i) {
        std::wstring commandLine = L"\"" + BesideMe(L"activation_client.exe") + L"\" --event " + eventName +
                                   L" --delay " + std::to_wstring(spread(random));
        runners.emplace_back(
            [&, i, commandLine] { codes[i] = RunAndCapture(commandLine, outputs[i], kClientTimeoutMs); });
    }
    Sleep(300); // every client is waiting for the event
    SetEvent(go.Get());
    for (auto &runner : runners)
        runner.join();
    int failed = 0, hung = 0;
    unsigned long long longest = 0;
    std::string failures;
    for (int i = 0; i < clients; ++i) {
        ++totals.started;
        std::string &out = outputs[i];
        unsigned long long ms = 0;
        if (codes[i] == -1 && out.empty()) {
            ++hung; // not started, or no end within the time limit
        } else if (sscanf(out.c_str(), "ok %llu", &ms) == 1) {
            longest = std::max(longest, ms);
        } else {
            ++failed;
            while (!out.empty() && (out.back() == '\n' || out.back() == '\r'))
                out.pop_back();
            failures += " (" + out + ")";
        }
    }
    totals.failed += failed;
    totals.hung += hung;
    totals.longestMs = std::max(totals.longestMs, longest);
    printf("round %3d: %d clients, %d failed, %d hung, longest activation %llu ms, server processes %d%s\n", round,
           clients, failed, hung, longest, CountServerProcesses(), failures.c_str());
    fflush(stdout);
}

// The pause after a round: none, brief, around the idle server's stop (it
// waits about 5 s, then drains 1.5 s), or past its exit.
DWORD PauseAfter(int round, std::mt19937 &random)
{
    switch (round % 5) {
    case 0:
        return 0;
    case 1:
        return 1000;
    case 2:
        return std::uniform_int_distribution<DWORD>(4500, 7500)(random);
    case 3:
        return 12000;
    default:
        return 300;
    }
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    int clients = argc > 1 ? _wtoi(argv[1]) : 8;
    int rounds = argc > 2 ? _wtoi(argv[2]) : 50;
    if (clients < 1 || rounds < 1) {
        fprintf(stderr, "usage: activation_churn [clients] [rounds]\n");
        return 2;
    }
    if (CountServerProcesses() != 0) {
        fprintf(stderr, "a server process is running already: stop it first\n");
        return 2;
    }
    std::mt19937 random(GetTickCount());
    Totals totals;
    ULONGLONG begin = GetTickCount64();
    for (int round = 1; round <= rounds; ++round) {
        RunRound(round, clients, random, totals);
        if (round < rounds)
            Sleep(PauseAfter(round, random));
    }
    printf("waiting 30 s for the server to exit...\n");
    fflush(stdout);
    Sleep(30000);
    int left = CountServerProcesses();
    printf("\n%d clients x %d rounds in %.0f s: %d activations, %d failed, %d hung, longest activation %llu ms, "
           "server processes left after 30 s: %d\n",
           clients, rounds, (GetTickCount64() - begin) / 1000.0, totals.started, totals.failed, totals.hung,
           totals.longestMs, left);
    return totals.failed == 0 && totals.hung == 0 && left == 0 ? 0 : 1;
}
