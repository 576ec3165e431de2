// What one OnDataChange of N items costs at the least on this machine's COM,
// beside what the baseline server's calls of the same size cost, so that
// the baseline can be shown to be a floor rather than assumed one.
//
// The least is a stripped copy of the call: the sender marshals the same
// arguments with the platform's own VARIANT marshalling into one reused
// buffer (no allocation, no COM bookkeeping), writes them in the fragments
// that the platform's RPC runtime uses on its local transport (a
// message-mode named pipe, at most 5,840 bytes a fragment) to a receiver
// process, which reads each fragment as the runtime does (header, then the
// rest), unmarshals and frees the values, and answers with one small
// fragment, as the call's return does. Whatever a COM server does, its call
// carries these bytes through this transport and its values through this
// marshalling: nothing that uses the standard proxy can send it with less.
//
// Usage: transport_floor [N]   (items per call, 10,000 by default)
//        transport_floor --receive PIPE   (the receiving side; internal)
#include "BaselineProcess.h"
#include "ComObject.h"
#include "ComPtr.h"
#include "DataChangeSink.h"
#include "Handle.h"
#include "OpcErrors.h"
#include "ProcessTimes.h"
#include "opcda.h"

#include <oleauto.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace {
using Clock = std::chrono::steady_clock;

// The runtime's largest fragment on the local transport, and its headers in
// each: the common header (16 bytes), the request's (8) and the object's id
// that every COM call carries (16).
const DWORD kFragmentBytes = 5840;
const DWORD kCommonHeader = 16;
const DWORD kFragmentHeader = 40;
const unsigned char kLastFragment = 0x02;
const DWORD kReplyBytes = kFragmentHeader + 32; // the return value and the ORPC answer
const ULONG kMarshalFlags = MAKELONG(MSHCTX_LOCAL, NDR_LOCAL_DATA_REPRESENTATION);
const DWORD kWindowMs = 2000;
const int kRounds = 3;

ULONG Align(ULONG offset, ULONG to)
{
    return (offset + to - 1) & ~(to - 1);
}

// OnDataChange's arguments as a sender holds them: N values of VT_R8 with
// their handles, qualities, time stamps and codes, as the baseline sends.
struct Arguments {
    explicit Arguments(DWORD n) : handles(n), values(n), qualities(n, OPC_QUALITY_GOOD), times(n), errors(n, S_OK)
    {
        FILETIME now;
        GetSystemTimeAsFileTime(&now);
        for (DWORD i = 0; i < n; ++i) {
            handles[i] = i;
            V_VT(&values[i]) = VT_R8;
            V_R8(&values[i]) = i;
            times[i] = now;
        }
    }
    std::vector<OPCHANDLE> handles;
    std::vector<VARIANT> values;
    std::vector<WORD> qualities;
    std::vector<FILETIME> times;
    std::vector<HRESULT> errors;
};

// The call's body in network data representation: five numbers, then each
// array as its count and its elements; a VARIANT array's elements are a
// pointer id each and then the values, which the platform's VARIANT
// marshalling writes. Offsets are from an 8-aligned start.
class CallBody {
public:
    // Bytes of the body for args.
    static ULONG Size(Arguments &args)
    {
        const ULONG n = static_cast<ULONG>(args.handles.size());
        ULONG offset = Flat(20, n, 4); // the five numbers, the handles
        offset = Align(offset, 4) + 4 + 4 * n;
        for (VARIANT &v : args.values) {
            ULONG flags = kMarshalFlags;
            offset = VARIANT_UserSize(&flags, offset, &v);
        }
        offset = Flat(offset, n, sizeof(WORD));
        offset = Flat(offset, n, sizeof(FILETIME));
        return Flat(offset, n, sizeof(HRESULT));
    }

    // Writes the body of args at out (of Size(args) bytes, 8-aligned).
    static void Marshal(Arguments &args, unsigned char *out)
    {
        const ULONG n = static_cast<ULONG>(args.handles.size());
        memset(out, 0, 20);
        memcpy(out + 16, &n, 4);
        ULONG offset = Put(out, 20, args.handles.data(), n, 4);
        offset = Align(offset, 4);
        memcpy(out + offset, &n, 4);
        offset += 4;
        for (ULONG i = 0; i < n; ++i, offset += 4) {
            const ULONG pointerId = 0x20000 + 4 * i;
            memcpy(out + offset, &pointerId, 4);
        }
        unsigned char *at = out + offset;
        for (VARIANT &v : args.values) {
            ULONG flags = kMarshalFlags;
            at = VARIANT_UserMarshal(&flags, at, &v);
        }
        offset = static_cast<ULONG>(at - out);
        offset = Put(out, offset, args.qualities.data(), n, sizeof(WORD));
        offset = Put(out, offset, args.times.data(), n, sizeof(FILETIME));
        Put(out, offset, args.errors.data(), n, sizeof(HRESULT));
    }

    // Reads the values back as a stub does, then frees them as it does
    // after the call; false when the body does not hold n values.
    static bool UnmarshalAndFree(const unsigned char *body, ULONG size, std::vector<VARIANT> &values)
    {
        if (size < 20)
            return false;
        ULONG n;
        memcpy(&n, body + 16, 4);
        values.assign(n, VARIANT{});
        ULONG offset = Align(Align(20, 4) + 4 + 4 * n, 4) + 4 + 4 * n;
        if (offset > size)
            return false;
        unsigned char *at = const_cast<unsigned char *>(body) + offset;
        for (VARIANT &v : values) {
            ULONG flags = kMarshalFlags;
            at = VARIANT_UserUnmarshal(&flags, at, &v);
        }
        for (VARIANT &v : values) {
            ULONG flags = kMarshalFlags;
            VARIANT_UserFree(&flags, &v);
        }
        return static_cast<ULONG>(at - body) <= size;
    }

private:
    static ULONG Flat(ULONG offset, ULONG n, ULONG bytes) { return Align(offset, 4) + 4 + n * bytes; }
    static ULONG Put(unsigned char *out, ULONG offset, const void *items, ULONG n, ULONG bytes)
    {
        offset = Align(offset, 4);
        memcpy(out + offset, &n, 4);
        memcpy(out + offset + 4, items, static_cast<size_t>(n) * bytes);
        return offset + 4 + n * bytes;
    }
};

// A buffer whose start is 8-aligned, as the runtime's are.
class Buffer {
public:
    unsigned char *Get(size_t bytes)
    {
        m_words.resize((bytes + 7) / 8);
        return reinterpret_cast<unsigned char *>(m_words.data());
    }

private:
    std::vector<unsigned long long> m_words;
};

struct Figures {
    double itemsPerSecond = 0, senderUs = 0, receiverUs = 0;
};

Figures Best(const std::vector<Figures> &windows)
{
    Figures best;
    for (const Figures &w : windows)
        if (w.itemsPerSecond > best.itemsPerSecond)
            best = w;
    return best;
}

void Print(const char *what, const std::vector<Figures> &windows)
{
    printf("  %-34s", what);
    for (const Figures &w : windows)
        printf(" %8.0f", w.itemsPerSecond);
    Figures b = Best(windows);
    printf("  best %8.0f items/s, processor per item %.3f us sending, %.3f us receiving\n", b.itemsPerSecond,
           b.senderUs, b.receiverUs);
}

// Measures what happens in windowMs while run() keeps calling, with the
// processor time of sender and receiver.
template <class Run>
Figures Window(HANDLE sender, HANDLE receiver, const std::atomic<unsigned long long> &items, Run run)
{
    unsigned long long before = items;
    double senderBefore = ProcessCpuSeconds(sender), receiverBefore = ProcessCpuSeconds(receiver);
    auto start = Clock::now();
    run();
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    double delivered = static_cast<double>(items - before);
    Figures f;
    if (delivered > 0) {
        f.itemsPerSecond = delivered / seconds;
        f.senderUs = (ProcessCpuSeconds(sender) - senderBefore) * 1e6 / delivered;
        f.receiverUs = (ProcessCpuSeconds(receiver) - receiverBefore) * 1e6 / delivered;
    }
    return f;
}

// ---- the stripped call ------------------------------------------------------

// The receiving side: fragments in, one answer per call, until the pipe
// closes.
int Receive(const wchar_t *pipeName)
{
    UniqueHandle pipe(CreateFileW(pipeName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr));
    if (!pipe)
        return 1;
    DWORD mode = PIPE_READMODE_MESSAGE;
    SetNamedPipeHandleState(pipe.Get(), &mode, nullptr, nullptr);
    std::vector<unsigned char> fragment(kFragmentBytes), reply(kReplyBytes);
    Buffer body;
    std::vector<unsigned char> call;
    std::vector<VARIANT> values;
    for (;;) {
        DWORD got = 0;
        if (!ReadFile(pipe.Get(), fragment.data(), kCommonHeader, &got, nullptr) && GetLastError() != ERROR_MORE_DATA)
            return 0;
        if (got != kCommonHeader)
            return 0;
        uint16_t length;
        memcpy(&length, fragment.data() + 8, 2);
        if (length < kFragmentHeader || length > kFragmentBytes ||
            !ReadFile(pipe.Get(), fragment.data() + kCommonHeader, length - kCommonHeader, &got, nullptr))
            return 0;
        call.insert(call.end(), fragment.begin() + kFragmentHeader, fragment.begin() + length);
        if (!(fragment[3] & kLastFragment))
            continue;
        unsigned char *copy = body.Get(call.size());
        memcpy(copy, call.data(), call.size());
        CallBody::UnmarshalAndFree(copy, static_cast<ULONG>(call.size()), values);
        call.clear();
        reply[3] = kLastFragment;
        uint16_t replyLength = kReplyBytes;
        memcpy(reply.data() + 8, &replyLength, 2);
        DWORD written;
        if (!WriteFile(pipe.Get(), reply.data(), kReplyBytes, &written, nullptr))
            return 0;
    }
}

// The sending side: this process, one call after another to a receiver
// process, for as long as it is asked to.
class StrippedCall {
public:
    explicit StrippedCall(DWORD n) : m_args(n)
    {
        std::wstring name = L"\\\\.\\pipe\\transport_floor_" + std::to_wstring(GetCurrentProcessId());
        m_pipe.Reset(CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX, PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE, 1,
                                      kFragmentBytes, kFragmentBytes, 0, nullptr));
        wchar_t exe[MAX_PATH];
        GetModuleFileNameW(nullptr, exe, MAX_PATH);
        std::wstring command = L"\"" + std::wstring(exe) + L"\" --receive " + name;
        STARTUPINFOW si = {};
        si.cb = sizeof(si);
        PROCESS_INFORMATION pi = {};
        if (!m_pipe || !CreateProcessW(nullptr, &command[0], nullptr, nullptr, FALSE, 0, nullptr, nullptr, &si, &pi))
            return;
        m_receiver.Reset(pi.hProcess);
        UniqueHandle thread(pi.hThread);
        m_connected = ConnectNamedPipe(m_pipe.Get(), nullptr) || GetLastError() == ERROR_PIPE_CONNECTED;
    }
    ~StrippedCall()
    {
        m_pipe.Reset(); // the receiver ends when its pipe closes
        if (m_receiver)
            WaitForSingleObject(m_receiver.Get(), 10000);
    }
    StrippedCall(const StrippedCall &) = delete;
    StrippedCall &operator=(const StrippedCall &) = delete;

    bool Ready() const { return m_connected; }
    HANDLE Receiver() const { return m_receiver.Get(); }
    const std::atomic<unsigned long long> &Items() const { return m_items; }

    // Calls back to back for ms milliseconds.
    void Run(DWORD ms)
    {
        auto end = Clock::now() + std::chrono::milliseconds(ms);
        while (Clock::now() < end && Call())
            m_items += m_args.handles.size();
    }

private:
    bool Call()
    {
        ULONG size = CallBody::Size(m_args);
        unsigned char *body = m_body.Get(size);
        CallBody::Marshal(m_args, body);
        const DWORD room = kFragmentBytes - kFragmentHeader;
        for (ULONG sent = 0; sent < size;) {
            DWORD part = std::min<DWORD>(room, size - sent);
            uint16_t length = static_cast<uint16_t>(kFragmentHeader + part);
            memset(m_fragment, 0, kFragmentHeader);
            m_fragment[3] = sent + part == size ? kLastFragment : 0;
            memcpy(m_fragment + 8, &length, 2);
            memcpy(m_fragment + kFragmentHeader, body + sent, part);
            DWORD written;
            if (!WriteFile(m_pipe.Get(), m_fragment, length, &written, nullptr))
                return false;
            sent += part;
        }
        unsigned char reply[kReplyBytes];
        DWORD got;
        return ReadFile(m_pipe.Get(), reply, sizeof reply, &got, nullptr) != FALSE;
    }

    Arguments m_args;
    Buffer m_body;
    unsigned char m_fragment[kFragmentBytes];
    UniqueHandle m_pipe, m_receiver;
    bool m_connected = false;
    std::atomic<unsigned long long> m_items{0};
};

// ---- the baseline server through COM ----------------------------------------

class CountingSink : public CDataChangeSink {
public:
    STDMETHODIMP OnDataChange(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD count, OPCHANDLE *, VARIANT *, WORD *,
                              FILETIME *, HRESULT *) override
    {
        items += count;
        return S_OK;
    }
    std::atomic<unsigned long long> items{0};
};

// In-process cost of the marshalling alone, per item: sizing and writing
// on the sending side, reading and freeing on the receiving one.
void PrintMarshalling(DWORD n)
{
    Arguments args(n);
    Buffer buffer;
    std::vector<VARIANT> values;
    const int kCalls = std::max<int>(20, static_cast<int>(2000000 / n));
    ULONG size = 0;
    auto start = Clock::now();
    for (int i = 0; i < kCalls; ++i) {
        size = CallBody::Size(args);
        CallBody::Marshal(args, buffer.Get(size));
    }
    auto mid = Clock::now();
    for (int i = 0; i < kCalls; ++i)
        CallBody::UnmarshalAndFree(buffer.Get(size), size, values);
    auto end = Clock::now();
    double items = static_cast<double>(kCalls) * n;
    printf(
        "  one call of %lu VT_R8 items: %lu bytes (%.1f per item), in %lu fragments of at most %lu bytes\n",
        static_cast<unsigned long>(n), static_cast<unsigned long>(size), static_cast<double>(size) / n,
        static_cast<unsigned long>((size + kFragmentBytes - kFragmentHeader - 1) / (kFragmentBytes - kFragmentHeader)),
        static_cast<unsigned long>(kFragmentBytes));
    printf("  marshalling alone, in process: %.3f us per item sending, %.3f us receiving\n",
           std::chrono::duration<double, std::micro>(mid - start).count() / items,
           std::chrono::duration<double, std::micro>(end - mid).count() / items);
}

// The baseline server as a benchmark reaches it, sending from a thread of
// the given kind of apartment.
class Baseline {
public:
    Baseline(DWORD n, bool singleThreaded)
        : m_process(n, singleThreaded), m_point(m_process.Query<IConnectionPoint>(IID_IConnectionPoint)),
          m_sink(NewComObject<CountingSink>())
    {
    }
    bool Ready() const { return m_point.Get() != nullptr; }
    // One window of its calls, after a warm-up.
    Figures Window()
    {
        DWORD cookie = 0;
        m_point->Advise(static_cast<IOPCDataCallback *>(m_sink.Get()), &cookie);
        Sleep(500);
        Figures f = ::Window(m_process.Process(), GetCurrentProcess(), m_sink->items, [] { Sleep(kWindowMs); });
        m_point->Unadvise(cookie);
        return f;
    }

private:
    BaselineProcess m_process; // first: it goes last, after its object
    ComPtr<IConnectionPoint> m_point;
    ComPtr<CountingSink> m_sink;
};

int Compare(DWORD n)
{
    printf("OnDataChange of %lu items, back to back, %d windows of %lu ms each in turns:\n",
           static_cast<unsigned long>(n), kRounds, static_cast<unsigned long>(kWindowMs));
    PrintMarshalling(n);
    StrippedCall stripped(n);
    Baseline multi(n, false), single(n, true);
    if (!stripped.Ready() || !multi.Ready() || !single.Ready()) {
        printf("  %s did not start\n", stripped.Ready() ? "the baseline server" : "the receiving process");
        return 1;
    }
    std::vector<Figures> least, base, sta;
    stripped.Run(500); // warm-up: the pipe's buffers and the receiver's pages
    for (int round = 0; round < kRounds; ++round) {
        least.push_back(
            Window(GetCurrentProcess(), stripped.Receiver(), stripped.Items(), [&] { stripped.Run(kWindowMs); }));
        base.push_back(multi.Window());
        sta.push_back(single.Window());
    }
    Print("stripped call (marshal, fragments)", least);
    Print("baseline server (sending in MTA)", base);
    Print("baseline, sending from an STA", sta);
    Figures l = Best(least), b = Best(base);
    if (l.itemsPerSecond > 0 && l.senderUs > 0)
        printf("  baseline / stripped call: %.2f of the rate, %.2f of the sender's processor per item\n",
               b.itemsPerSecond / l.itemsPerSecond, b.senderUs / l.senderUs);
    return 0;
}
} // namespace

int wmain(int argc, wchar_t **argv)
{
    if (argc >= 3 && wcscmp(argv[1], L"--receive") == 0)
        return Receive(argv[2]);
    DWORD n = argc > 1 ? wcstoul(argv[1], nullptr, 10) : 10000;
    if (n == 0 || n > 1000000) {
        fprintf(stderr, "usage: transport_floor [N] (1 to 1000000 items per call)\n");
        return 2;
    }
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    int status = Compare(n);
    CoUninitialize();
    return status;
}
