#pragma once
// Processor time and memory of a process, for the benchmarks' figures per
// item.
#include <windows.h>

// Kernel and user time a process has used so far, in seconds; 0 when it is
// not found. Read from the system's process list: under Wine,
// GetProcessTimes answers with the calling process's times for any handle.
double ProcessCpuSeconds(HANDLE process);
// Working set of a process in MiB, from the same list; 0 when not found.
double ProcessWorkingSetMiB(HANDLE process);
// Its threads, from the same list; 0 when not found.
unsigned long ProcessThreadCount(HANDLE process);
