#include "Trace.h"

#include <windows.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {
std::atomic<long> g_failures{0};

bool TraceToStderr()
{
    static const bool enabled = [] {
        const char *v = getenv("SKYLARC_TRACE");
        return v && strcmp(v, "1") == 0;
    }();
    return enabled;
}

// A file that traces are appended to, for processes whose output nobody
// reads (a server that COM started): SKYLARC_TRACE_FILE names it.
const char *TraceFile()
{
    static const char *const path = getenv("SKYLARC_TRACE_FILE");
    return path && *path ? path : nullptr;
}

// Status traces come per item (three for every subscription made): nothing
// is formatted unless someone reads the text.
bool Heard()
{
    return IsDebuggerPresent() || TraceToStderr() || TraceFile();
}

void Emit(const char *text)
{
    // OutputDebugString costs a round trip through the system on every call
    // (tens of microseconds under Wine): the text goes to a debugger only
    // when one is attached.
    if (IsDebuggerPresent())
        OutputDebugStringA(text);
    if (TraceToStderr())
        fputs(text, stderr);
    if (const char *path = TraceFile()) {
        if (FILE *file = fopen(path, "a")) {
            fputs(text, file);
            fclose(file);
        }
    }
}
} // namespace

void Trace(const char *format, ...)
{
    if (!Heard())
        return;
    char text[1024];
    va_list args;
    va_start(args, format);
    vsnprintf(text, sizeof text, format, args);
    va_end(args);
    Emit(text);
}

void AssertionFailure(const char *file, int line, const char *what)
{
    ++g_failures;
    char text[512];
    snprintf(text, sizeof text, "internal assertion failure: %s (%s:%d)\n", what, file, line);
    Emit(text);
}

long AssertionFailureCount()
{
    return g_failures.load();
}
