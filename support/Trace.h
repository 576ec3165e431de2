#pragma once
// Diagnostics. Trace texts and internal assertion failures go to the debugger
// output (OutputDebugString) while a debugger is attached; setting the
// environment variable SKYLARC_TRACE to 1 also copies them to stderr.
#include <cstdarg>

void Trace(const char *format, ...) __attribute__((format(printf, 1, 2)));

// The program's own bookkeeping is inconsistent, or a system call that cannot
// fail did. The caller goes on with the result its operation defines.
void AssertionFailure(const char *file, int line, const char *what);

// Number of assertion failures so far (tests check that none happened).
long AssertionFailureCount();

#define INTERNAL_ASSERT_FAILED(what) AssertionFailure(__FILE__, __LINE__, what)
