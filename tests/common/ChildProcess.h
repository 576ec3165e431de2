#pragma once
// Runs a program of the build for a test and collects what it prints.
#include <windows.h>

#include <string>

// Runs commandLine with its output captured; returns its exit code, or -1
// when it cannot be started or does not end within timeoutMs.
long RunAndCapture(const std::wstring &commandLine, std::string &output, DWORD timeoutMs = 30000);
