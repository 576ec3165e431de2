// The baseline of the benchmarks: a minimal COM server whose answers cost
// nothing but the COM transport and their task memory, so that a benchmark
// can put what our server takes beside what any server must take on this
// machine at this moment.
// - IConnectionPoint: sends precomputed OnDataChange calls of N items,
//   every 10 ms or back to back when a call takes longer, to the one sink
//   advised on it.
// - IOPCItemMgt (AddItems, ValidateItems) and IOPCSyncIO (Read): answer
//   every item at once without looking anything up (a double, readable and
//   writable, good quality).
//
// Usage: baseline_server N CLIENT_PID [sta]. With sta the calls go from a
// thread of a single-threaded apartment (else of the multithreaded one), to
// compare what each costs a sender. It writes its object's IUnknown,
// marshalled for another process on this machine, as one line of hex on
// stdout, and exits once the client has released it or has ended.
#include "ComObject.h"
#include "ComPtr.h"
#include "ExitWatchdog.h"
#include "Handle.h"
#include "OpcErrors.h"
#include "TaskMem.h"
#include "opcda.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <ocidl.h>
#include <olectl.h>
#include <thread>
#include <vector>

namespace {
const DWORD kRateMs = 10;

class BaselineSource : public CComObjectRoot, public IConnectionPoint, public IOPCItemMgt, public IOPCSyncIO {
public:
    BaselineSource(DWORD items, HANDLE released, DWORD apartment)
        : m_released(released), m_apartment(apartment), m_handles(items), m_values(items),
          m_qualities(items, OPC_QUALITY_GOOD), m_times(items), m_errors(items, S_OK)
    {
        FILETIME now;
        GetSystemTimeAsFileTime(&now);
        for (DWORD i = 0; i < items; ++i) {
            m_handles[i] = i;
            V_VT(&m_values[i]) = VT_R8;
            V_R8(&m_values[i]) = i;
            m_times[i] = now;
        }
    }
    ~BaselineSource() override { Stop(); }
    DECLARE_COM_UNKNOWN()

    STDMETHODIMP GetConnectionInterface(IID *iid) override
    {
        if (!iid)
            return E_POINTER;
        *iid = IID_IOPCDataCallback;
        return S_OK;
    }
    STDMETHODIMP GetConnectionPointContainer(IConnectionPointContainer **) override { return E_NOTIMPL; }
    STDMETHODIMP Advise(IUnknown *sink, DWORD *cookie) override
    {
        if (!sink || !cookie)
            return E_POINTER;
        if (m_sender.joinable())
            return CONNECT_E_ADVISELIMIT;
        ComPtr<IOPCDataCallback> callback;
        if (FAILED(sink->QueryInterface(IID_IOPCDataCallback, reinterpret_cast<void **>(callback.Out()))))
            return CONNECT_E_CANNOTCONNECT;
        // The sending thread takes the sink into its own apartment.
        IStream *stream = nullptr;
        if (FAILED(CoMarshalInterThreadInterfaceInStream(IID_IOPCDataCallback, callback.Get(), &stream)))
            return CONNECT_E_CANNOTCONNECT;
        m_stop = false;
        m_sender = std::thread([this, stream] { Send(stream); });
        *cookie = 1;
        return S_OK;
    }
    STDMETHODIMP Unadvise(DWORD cookie) override
    {
        if (cookie != 1 || !m_sender.joinable())
            return CONNECT_E_NOCONNECTION;
        Stop();
        return S_OK;
    }
    STDMETHODIMP EnumConnections(IEnumConnections **) override { return E_NOTIMPL; }

    // IOPCItemMgt: what AddItems and ValidateItems must send back at the least.
    STDMETHODIMP AddItems(DWORD count, OPCITEMDEF *items, OPCITEMRESULT **results, HRESULT **errors) override
    {
        return ItemResults(count, items, results, errors);
    }
    STDMETHODIMP ValidateItems(DWORD count, OPCITEMDEF *items, BOOL, OPCITEMRESULT **results, HRESULT **errors) override
    {
        return ItemResults(count, items, results, errors);
    }
    STDMETHODIMP RemoveItems(DWORD, OPCHANDLE *, HRESULT **) override { return E_NOTIMPL; }
    STDMETHODIMP SetActiveState(DWORD, OPCHANDLE *, BOOL, HRESULT **) override { return E_NOTIMPL; }
    STDMETHODIMP SetClientHandles(DWORD, OPCHANDLE *, OPCHANDLE *, HRESULT **) override { return E_NOTIMPL; }
    STDMETHODIMP SetDatatypes(DWORD, OPCHANDLE *, VARTYPE *, HRESULT **) override { return E_NOTIMPL; }
    STDMETHODIMP CreateEnumerator(REFIID, IUnknown **) override { return E_NOTIMPL; }

    // IOPCSyncIO: the values of a cache read.
    STDMETHODIMP Read(OPCDATASOURCE, DWORD count, OPCHANDLE *handles, OPCITEMSTATE **states, HRESULT **errors) override
    {
        FILETIME time = m_times[0];
        return Answer(count, handles, states, errors, [&](DWORD i, OPCITEMSTATE &state) {
            state.hClient = handles[i];
            state.ftTimeStamp = time;
            state.wQuality = OPC_QUALITY_GOOD;
            V_VT(&state.vDataValue) = VT_R8;
            V_R8(&state.vDataValue) = i;
        });
    }
    STDMETHODIMP Write(DWORD, OPCHANDLE *, VARIANT *, HRESULT **) override { return E_NOTIMPL; }

private:
    void *FindInterface(REFIID riid) override
    {
        if (IsEqualIID(riid, IID_IConnectionPoint))
            return static_cast<IConnectionPoint *>(this);
        if (IsEqualIID(riid, IID_IOPCItemMgt))
            return static_cast<IOPCItemMgt *>(this);
        if (IsEqualIID(riid, IID_IOPCSyncIO))
            return static_cast<IOPCSyncIO *>(this);
        return nullptr;
    }

    static HRESULT ItemResults(DWORD count, const OPCITEMDEF *items, OPCITEMRESULT **results, HRESULT **errors)
    {
        return Answer(count, items, results, errors, [](DWORD i, OPCITEMRESULT &result) {
            result.hServer = i + 1;
            result.vtCanonicalDataType = VT_R8;
            result.dwAccessRights = OPC_READABLE | OPC_WRITEABLE;
        });
    }

    // Checks the arguments as a server must, then fills count records
    // (fill(i, record)) and as many S_OK codes.
    template <class Record, class Fill>
    static HRESULT Answer(DWORD count, const void *input, Record **records, HRESULT **errors, Fill fill)
    {
        if (!records || !errors)
            return E_POINTER;
        *records = nullptr;
        *errors = nullptr;
        if (count == 0 || !input)
            return E_INVALIDARG;
        TaskMem<Record> out;
        TaskMem<HRESULT> codes;
        if (!out.Allocate(count) || !codes.Allocate(count))
            return E_OUTOFMEMORY;
        for (DWORD i = 0; i < count; ++i)
            fill(i, out[i]);
        *records = out.Detach();
        *errors = codes.Detach();
        return S_OK;
    }

    void FinalRelease() override
    {
        Stop();
        SetEvent(m_released);
    }

    void Send(IStream *stream)
    {
        CoInitializeEx(nullptr, m_apartment);
        {
            ComPtr<IOPCDataCallback> sink;
            if (SUCCEEDED(CoGetInterfaceAndReleaseStream(stream, IID_IOPCDataCallback,
                                                         reinterpret_cast<void **>(sink.Out()))))
                SendTo(sink.Get());
        }
        CoUninitialize();
    }
    void SendTo(IOPCDataCallback *sink)
    {
        const DWORD n = static_cast<DWORD>(m_handles.size());
        ULONGLONG due = GetTickCount64();
        while (!m_stop) {
            sink->OnDataChange(0, 1, S_OK, S_OK, n, m_handles.data(), m_values.data(), m_qualities.data(),
                               m_times.data(), m_errors.data());
            due += kRateMs;
            ULONGLONG now = GetTickCount64();
            if (due > now)
                Sleep(static_cast<DWORD>(due - now));
            else
                due = now; // late: the next call goes at once
        }
    }
    void Stop()
    {
        m_stop = true;
        if (m_sender.joinable())
            m_sender.join();
    }

    HANDLE m_released;
    DWORD m_apartment; // the sending thread's
    std::vector<OPCHANDLE> m_handles;
    std::vector<VARIANT> m_values;
    std::vector<WORD> m_qualities;
    std::vector<FILETIME> m_times;
    std::vector<HRESULT> m_errors;
    std::atomic<bool> m_stop{false};
    std::thread m_sender;
};

bool WriteMarshalled(IUnknown *object)
{
    ComPtr<IStream> stream;
    if (FAILED(CreateStreamOnHGlobal(nullptr, TRUE, stream.Out())) ||
        FAILED(CoMarshalInterface(stream.Get(), IID_IUnknown, object, MSHCTX_LOCAL, nullptr, MSHLFLAGS_NORMAL)))
        return false;
    HGLOBAL memory = nullptr;
    GetHGlobalFromStream(stream.Get(), &memory);
    const auto *bytes = static_cast<const unsigned char *>(GlobalLock(memory));
    for (SIZE_T i = 0, size = GlobalSize(memory); i < size; ++i)
        printf("%02x", bytes[i]);
    printf("\n");
    fflush(stdout);
    GlobalUnlock(memory);
    return true;
}
} // namespace

int main(int argc, char **argv)
{
    DWORD items = argc > 2 ? strtoul(argv[1], nullptr, 10) : 0;
    UniqueHandle client(OpenProcess(SYNCHRONIZE, FALSE, argc > 2 ? strtoul(argv[2], nullptr, 10) : 0));
    if (items == 0 || items > 1000000 || !client) {
        fprintf(stderr, "usage: baseline_server N CLIENT_PID (1 to 1000000 items per call)\n");
        return 2;
    }
    CoInitializeEx(nullptr, COINIT_MULTITHREADED);
    UniqueHandle released(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    int status = 1;
    {
        ComPtr<IUnknown> source;
        DWORD apartment = argc > 3 && strcmp(argv[3], "sta") == 0 ? COINIT_APARTMENTTHREADED : COINIT_MULTITHREADED;
        CreateComObject(NewComObject<BaselineSource>(items, released.Get(), apartment), IID_IUnknown,
                        reinterpret_cast<void **>(source.Out()));
        if (source && WriteMarshalled(source.Get()))
            status = 0;
    }
    // The client's proxy now holds the only reference.
    HANDLE ends[] = {released.Get(), client.Get()};
    if (status == 0)
        WaitForMultipleObjects(2, ends, FALSE, INFINITE);
    // A client that went without releasing leaves Wine's CoUninitialize
    // waiting forever to unregister the object's interface: the exit is
    // bounded, as the server's is, so that no baseline outlives its bench.
    CExitWatchdog watchdog(5000, static_cast<UINT>(status));
    CoUninitialize();
    return status;
}
