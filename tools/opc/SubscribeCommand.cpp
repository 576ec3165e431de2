// opc subscribe: an active group of the items whose changes are printed as
// the server sends them, through IOPCDataCallback (DA 2.0) or through
// IDataObject streams to an IAdviseSink (DA 1.0).
#include "ComObject.h"
#include "Commands.h"
#include "DataChangeSink.h"
#include "DataStream.h"
#include "Format.h"
#include "Handle.h"
#include "ItemLine.h"

#include <ocidl.h>

#include <atomic>

namespace {
// Set by Ctrl+C, the time limit or the change count.
HANDLE g_stop = nullptr;

BOOL WINAPI OnConsoleControl(DWORD)
{
    SetEvent(g_stop);
    return TRUE;
}

// What both sinks do with one item's change.
class ChangePrinter {
public:
    ChangePrinter(Output &out, const Connection &server, const std::vector<ItemGroup::Item> &items,
                  unsigned long long limit)
        : m_out(out), m_server(server), m_items(items), m_limit(limit)
    {
    }
    void Print(OPCHANDLE client, const VARIANT &value, WORD quality, const FILETIME &time, HRESULT error)
    {
        if (client >= m_items.size())
            return; // not one of ours
        unsigned long long n = ++m_printed;
        if (m_limit > 0 && n > m_limit)
            return; // past the count: the subscription is ending
        const std::wstring &id = m_items[client].id;
        if (FAILED(error))
            ReportItemError(m_out, m_server, L"subscribe", id, error);
        else
            m_out.Line(ItemValueLine(m_out.Json(), id, value, quality, time));
        if (n == m_limit)
            SetEvent(g_stop);
    }
    void Malformed() { m_out.Error(L"subscribe: the server sent a data stream that does not hold together"); }

private:
    Output &m_out;
    const Connection &m_server;
    const std::vector<ItemGroup::Item> &m_items;
    unsigned long long m_limit; // 0: no limit
    std::atomic<unsigned long long> m_printed{0};
};

class DataCallback : public CDataChangeSink {
public:
    explicit DataCallback(ChangePrinter &printer) : m_printer(printer) {}

    STDMETHODIMP OnDataChange(DWORD, OPCHANDLE, HRESULT, HRESULT, DWORD count, OPCHANDLE *clients, VARIANT *values,
                              WORD *qualities, FILETIME *times, HRESULT *errors) override
    {
        if (!clients || !values || !qualities || !times || !errors)
            return E_INVALIDARG;
        for (DWORD i = 0; i < count; ++i)
            m_printer.Print(clients[i], values[i], qualities[i], times[i], errors[i]);
        return S_OK;
    }

private:
    ChangePrinter &m_printer;
};

class StreamSink : public CComObjectRoot, public IAdviseSink {
public:
    StreamSink(ChangePrinter &printer, CLIPFORMAT format) : m_printer(printer), m_format(format) {}
    DECLARE_COM_UNKNOWN()

    STDMETHODIMP_(void) OnDataChange(FORMATETC *format, STGMEDIUM *medium) override
    {
        if (!format || format->cfFormat != m_format || !medium || medium->tymed != TYMED_HGLOBAL || !medium->hGlobal)
            return;
        SIZE_T size = GlobalSize(medium->hGlobal);
        const BYTE *bytes = static_cast<const BYTE *>(GlobalLock(medium->hGlobal));
        DataStream stream;
        bool ok = bytes && ReadDataStream(bytes, size, true, stream);
        if (bytes)
            GlobalUnlock(medium->hGlobal);
        if (!ok) {
            m_printer.Malformed();
            return;
        }
        for (const StreamItem &item : stream.items)
            m_printer.Print(item.client, item.value, item.quality, item.time, S_OK);
    }
    STDMETHODIMP_(void) OnViewChange(DWORD, LONG) override {}
    STDMETHODIMP_(void) OnRename(IMoniker *) override {}
    STDMETHODIMP_(void) OnSave() override {}
    STDMETHODIMP_(void) OnClose() override {}

private:
    void *FindInterface(REFIID riid) override
    {
        return IsEqualIID(riid, IID_IAdviseSink) ? static_cast<IAdviseSink *>(this) : nullptr;
    }
    ChangePrinter &m_printer;
    CLIPFORMAT m_format;
};

struct Limits {
    double rate = 1000, seconds = 0, count = 0, deadband = 0;
};

bool ReadLimits(const Arguments &args, Output &out, Limits &limits)
{
    struct {
        const wchar_t *option;
        double low, high;
        double *value;
        const wchar_t *what;
    } numbers[] = {{L"rate", 0, 4294967295.0, &limits.rate, L"milliseconds"},
                   {L"duration", 0.001, 4294967.0, &limits.seconds, L"seconds"},
                   {L"count", 1, 1e15, &limits.count, L"changes"},
                   {L"deadband", 0, 100, &limits.deadband, L"percent from 0 to 100"}};
    for (const auto &n : numbers)
        if (args.Has(n.option) && !ParseNumber(args.Value(n.option), n.low, n.high, *n.value)) {
            out.Error(std::wstring(L"--") + n.option + L" takes a number of " + n.what + L", not \"" +
                      args.Value(n.option) + L"\"");
            return false;
        }
    return true;
}

// Connects sink to the group the DA 2.0 or the DA 1.0 way; undone on
// destruction.
class Advice {
public:
    HRESULT Start(ItemGroup &group, IUnknown *sink, bool da1, CLIPFORMAT format)
    {
        if (da1) {
            if (FAILED(group.As(m_data)))
                return E_NOINTERFACE;
            ComPtr<IAdviseSink> streams;
            if (FAILED(sink->QueryInterface(IID_IAdviseSink, reinterpret_cast<void **>(streams.Out()))))
                return E_NOINTERFACE;
            FORMATETC wanted = {format, nullptr, DVASPECT_CONTENT, -1, TYMED_HGLOBAL};
            return m_data->DAdvise(&wanted, 0, streams.Get(), &m_cookie);
        }
        ComPtr<IConnectionPointContainer> container;
        HRESULT hr = group.As(container);
        if (SUCCEEDED(hr))
            hr = container->FindConnectionPoint(IID_IOPCDataCallback, m_point.Out());
        return SUCCEEDED(hr) ? m_point->Advise(sink, &m_cookie) : hr;
    }
    ~Advice()
    {
        if (m_point && m_cookie)
            m_point->Unadvise(m_cookie);
        if (m_data && m_cookie)
            m_data->DUnadvise(m_cookie);
    }

private:
    ComPtr<IConnectionPoint> m_point;
    ComPtr<IDataObject> m_data;
    DWORD m_cookie = 0;
};
} // namespace

bool CheckSubscribe(const Arguments &args, Output &out)
{
    VARTYPE requested;
    Limits limits;
    if (!RequestedType(args, out, requested) || !ReadLimits(args, out, limits))
        return false;
    if (args.Positional().empty()) {
        out.Error(L"subscribe needs at least one item (see opc subscribe --help)");
        return false;
    }
    return true;
}

int Subscribe(const Arguments &args, Output &out, Connection &server)
{
    VARTYPE requested;
    Limits limits;
    RequestedType(args, out, requested);
    ReadLimits(args, out, limits);
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    // Made active only once the sink is connected, so that the first scan,
    // which reports every item, reaches it: a constant is reported once.
    HRESULT hr =
        group.Create(server.Server(), static_cast<DWORD>(limits.rate), false, static_cast<float>(limits.deadband));
    if (SUCCEEDED(hr))
        hr = group.Add(args.Positional(), requested, items);
    if (FAILED(hr) && items.empty()) {
        out.Error(L"subscribe: " + server.Describe(hr));
        return kExitFailed;
    }
    bool failed = false;
    for (const ItemGroup::Item &item : items)
        if (FAILED(item.error)) {
            ReportItemError(out, server, L"subscribe", item.id, item.error);
            failed = true;
        }
    if (failed)
        return kExitFailed;

    UniqueHandle stop(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    g_stop = stop.Get();
    SetConsoleCtrlHandler(OnConsoleControl, TRUE);
    ChangePrinter printer(out, server, items, static_cast<unsigned long long>(limits.count));
    bool da1 = args.Has(L"da1");
    CLIPFORMAT format = static_cast<CLIPFORMAT>(RegisterClipboardFormatW(L"OPCSTMFORMATDATATIME"));
    ComPtr<IUnknown> sink;
    if (da1)
        CreateComObject(NewComObject<StreamSink>(printer, format), IID_IUnknown, reinterpret_cast<void **>(sink.Out()));
    else
        CreateComObject(NewComObject<DataCallback>(printer), IID_IUnknown, reinterpret_cast<void **>(sink.Out()));
    {
        Advice advice;
        hr = sink ? advice.Start(group, sink.Get(), da1, format) : E_OUTOFMEMORY;
        if (SUCCEEDED(hr))
            hr = group.Activate();
        if (FAILED(hr)) {
            out.Error(std::wstring(L"subscribe: the group takes no ") + (da1 ? L"data stream" : L"callback") + L": " +
                      server.Describe(hr));
            failed = true;
        } else {
            WaitForSingleObject(stop.Get(),
                                limits.seconds > 0 ? static_cast<DWORD>(limits.seconds * 1000 + 0.5) : INFINITE);
        }
    }
    // No call the server still has in flight may reach the printer after this.
    CoDisconnectObject(sink.Get(), 0);
    sink.Reset();
    SetConsoleCtrlHandler(OnConsoleControl, FALSE);
    g_stop = nullptr;
    return failed ? kExitFailed : kExitOk;
}
