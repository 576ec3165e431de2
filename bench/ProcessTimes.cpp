#include "ProcessTimes.h"

#include <vector>

namespace {
// The documented head of SYSTEM_PROCESS_INFORMATION (the SDK's own
// declaration hides the times among reserved bytes).
struct ProcessEntry {
    ULONG nextEntryOffset;
    ULONG numberOfThreads;
    LARGE_INTEGER workingSetPrivateSize;
    ULONG hardFaultCount;
    ULONG numberOfThreadsHighWatermark;
    ULONGLONG cycleTime;
    LARGE_INTEGER createTime;
    LARGE_INTEGER userTime;
    LARGE_INTEGER kernelTime;
    USHORT imageNameLength;
    USHORT imageNameMaximumLength;
    PWSTR imageNameBuffer;
    LONG basePriority;
    HANDLE uniqueProcessId;
    HANDLE inheritedFromUniqueProcessId;
    ULONG handleCount;
    ULONG sessionId;
    ULONG_PTR uniqueProcessKey;
    SIZE_T peakVirtualSize;
    SIZE_T virtualSize;
    ULONG pageFaultCount;
    SIZE_T peakWorkingSetSize;
    SIZE_T workingSetSize;
};

using QuerySystemInformation = LONG(WINAPI *)(ULONG, PVOID, ULONG, PULONG);
constexpr ULONG kSystemProcessInformation = 5;
constexpr LONG kInfoLengthMismatch = static_cast<LONG>(0xC0000004);

// Copies the system's entry for process; false when it is not found.
bool FindProcessEntry(HANDLE process, ProcessEntry &out)
{
    static auto query = reinterpret_cast<QuerySystemInformation>(
        reinterpret_cast<void *>(GetProcAddress(GetModuleHandleW(L"ntdll.dll"), "NtQuerySystemInformation")));
    DWORD pid = process ? GetProcessId(process) : 0;
    if (!query || !pid)
        return false;
    std::vector<char> buffer(1 << 18);
    ULONG length = 0;
    LONG status;
    while ((status = query(kSystemProcessInformation, buffer.data(), static_cast<ULONG>(buffer.size()), &length)) ==
               kInfoLengthMismatch &&
           buffer.size() < (64u << 20))
        buffer.resize(buffer.size() * 2);
    if (status != 0)
        return false;
    for (size_t offset = 0;;) {
        const auto *entry = reinterpret_cast<const ProcessEntry *>(buffer.data() + offset);
        if (reinterpret_cast<ULONG_PTR>(entry->uniqueProcessId) == pid) {
            out = *entry;
            return true;
        }
        if (!entry->nextEntryOffset)
            return false;
        offset += entry->nextEntryOffset;
    }
}

} // namespace

double ProcessCpuSeconds(HANDLE process)
{
    ProcessEntry entry;
    return FindProcessEntry(process, entry) ? (entry.userTime.QuadPart + entry.kernelTime.QuadPart) / 1e7 : 0;
}

double ProcessWorkingSetMiB(HANDLE process)
{
    ProcessEntry entry;
    return FindProcessEntry(process, entry) ? entry.workingSetSize / (1024.0 * 1024.0) : 0;
}

unsigned long ProcessThreadCount(HANDLE process)
{
    ProcessEntry entry;
    return FindProcessEntry(process, entry) ? entry.numberOfThreads : 0;
}
