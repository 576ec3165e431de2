#pragma once
// Helpers for end-to-end tests: the server's processes in this Wine prefix,
// running the executable with switches, and reading the registry back.
#include "ChildProcess.h"

#include <windows.h>

#include <string>

extern const CLSID CLSID_SkylarcOPCServerE2E;

// Number of running processes whose image is Local.exe, or image.
int CountServerProcesses();
int CountProcesses(const wchar_t *image);
// The id of a running Local.exe, or of the machine's network node, 0 when
// none.
DWORD ServerProcessId();
DWORD ProcessIdOf(const wchar_t *image);
DWORD NodeProcessId();
// Runs cadroctl against the network node only (test programs serve
// networks of their own too); -1 when no node runs.
long RunCadroctl(const std::wstring &arguments, std::string &output);
// Starts the machine's network node unless one runs; false when none
// answers within timeoutMs.
bool EnsureNode(DWORD timeoutMs);
// Waits up to timeoutMs for no server process to be left.
bool WaitForNoServerProcess(DWORD timeoutMs);
bool WaitForNoProcess(const wchar_t *image, DWORD timeoutMs);
// Full path of a program of the build (from SKYLARC_BIN_DIR, else beside
// this program).
std::wstring BinPath(const wchar_t *file);
inline std::wstring ServerExePath()
{
    return BinPath(L"Local.exe");
}
// Starts commandLine; null handle on failure.
HANDLE StartProcess(const std::wstring &commandLine);
// Runs commandLine and returns its exit code, or -1 if it cannot be started
// or does not end within timeoutMs.
long RunAndWait(const std::wstring &commandLine, DWORD timeoutMs);

bool KeyExists(HKEY root, const std::wstring &path);
// Value of a REG_SZ value (name null: the default), or "<missing>".
std::wstring ReadString(HKEY root, const std::wstring &path, const wchar_t *name);
