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
};

using QuerySystemInformation = LONG(WINAPI *)(ULONG, PVOID, ULONG, PULONG);
constexpr ULONG kSystemProcessInformation = 5;
constexpr LONG kInfoLengthMismatch = static_cast<LONG>(0xC0000004);
} // namespace

double ProcessCpuSeconds(HANDLE process)
{
    static auto query = reinterpret_cast<QuerySystemInformation>(
        reinterpret_cast<void *>(GetProcAddress(GetModuleHandleW(L"ntdll.dll"), "NtQuerySystemInformation")));
    DWORD pid = GetProcessId(process);
    if (!query || !pid)
        return 0;
    std::vector<char> buffer(1 << 18);
    ULONG length = 0;
    LONG status;
    while ((status = query(kSystemProcessInformation, buffer.data(), static_cast<ULONG>(buffer.size()), &length)) ==
               kInfoLengthMismatch &&
           buffer.size() < (64u << 20))
        buffer.resize(buffer.size() * 2);
    if (status != 0)
        return 0;
    for (size_t offset = 0;;) {
        const auto *entry = reinterpret_cast<const ProcessEntry *>(buffer.data() + offset);
        if (reinterpret_cast<ULONG_PTR>(entry->uniqueProcessId) == pid)
            return (entry->userTime.QuadPart + entry->kernelTime.QuadPart) / 1e7;
        if (!entry->nextEntryOffset)
            return 0;
        offset += entry->nextEntryOffset;
    }
}
