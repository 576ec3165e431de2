#include "Connection.h"

#include "Format.h"
#include "Handle.h"
#include "TaskMem.h"
#include "opccomn.h"

#include <atomic>

const wchar_t Connection::kDefaultServer[] = L"Tarnwell.SkylarcOPCServer";

namespace {
// The creation of an object on a thread of its own, so that the caller can
// give up waiting. Shared with that thread, which may outlive the wait.
struct Creation {
    CLSID clsid;
    IID iid;
    std::wstring host; // empty: this machine
    IUnknown *object = nullptr;
    HRESULT result = E_PENDING;
    std::atomic<long> refs{2}; // the caller's and the thread's

    static Creation *New(const CLSID &clsid, REFIID iid, const std::wstring &host)
    {
        auto *creation = new Creation();
        creation->clsid = clsid;
        creation->iid = iid;
        creation->host = host;
        return creation;
    }
    void Release()
    {
        if (--refs == 0) {
            if (object)
                object->Release();
            delete this;
        }
    }
    static DWORD WINAPI Run(void *context)
    {
        auto *self = static_cast<Creation *>(context);
        CoInitializeEx(nullptr, COINIT_MULTITHREADED);
        COSERVERINFO server = {};
        server.pwszName = const_cast<wchar_t *>(self->host.c_str());
        MULTI_QI query = {&self->iid, nullptr, S_OK};
        bool remote = !self->host.empty();
        self->result = CoCreateInstanceEx(self->clsid, nullptr, remote ? CLSCTX_REMOTE_SERVER : CLSCTX_LOCAL_SERVER,
                                          remote ? &server : nullptr, 1, &query);
        if (SUCCEEDED(self->result))
            self->result = query.hr;
        self->object = SUCCEEDED(self->result) ? query.pItf : nullptr;
        if (FAILED(self->result) && query.pItf)
            query.pItf->Release();
        CoUninitialize(); // the pointer lives on in the process's apartment
        self->Release();
        return 0;
    }
};
} // namespace

namespace {
std::atomic<bool> g_abandoned{false};
constexpr DWORD kRetryPauseMs = 200;

// One activation on a thread of its own; E_PENDING when it has not ended
// within waitMs (it is left to finish or fail on its own).
HRESULT CreateOnce(const CLSID &clsid, REFIID iid, const std::wstring &host, DWORD waitMs, ComPtr<IUnknown> &object)
{
    Creation *creation = Creation::New(clsid, iid, host);
    UniqueHandle thread(CreateThread(nullptr, 0, Creation::Run, creation, 0, nullptr));
    if (!thread) {
        Creation::Run(creation); // gives back the thread's reference only
    } else if (WaitForSingleObject(thread.Get(), waitMs) == WAIT_TIMEOUT) {
        g_abandoned = true;
        creation->Release();
        return E_PENDING;
    }
    HRESULT hr = creation->result;
    if (SUCCEEDED(hr)) {
        object = ComPtr<IUnknown>::Attach(creation->object);
        creation->object = nullptr;
    }
    creation->Release();
    return hr;
}
} // namespace

HRESULT CreateOutOfProcess(const CLSID &clsid, REFIID iid, const std::wstring &host, double timeoutSeconds,
                           ComPtr<IUnknown> &object)
{
    // COM waits for a server that hangs while it starts as long as the
    // server lives; opc gives up after the timeout. A server that was
    // stopping, or that went away while it was being reached, is asked again
    // while time is left.
    const ULONGLONG deadline = GetTickCount64() + static_cast<ULONGLONG>(timeoutSeconds * 1000);
    for (;;) {
        ULONGLONG now = GetTickCount64();
        DWORD left = now < deadline ? static_cast<DWORD>(deadline - now) : 0;
        HRESULT hr = CreateOnce(clsid, iid, host, left, object);
        if (hr == E_PENDING || !Connection::IsTransient(hr) || GetTickCount64() + kRetryPauseMs >= deadline)
            return hr;
        Sleep(kRetryPauseMs);
    }
}

bool Connection::IsTransient(HRESULT hr)
{
    switch (hr) {
    case CO_E_SERVER_STOPPING:
    case HRESULT_FROM_WIN32(RPC_S_SERVER_UNAVAILABLE):
    case HRESULT_FROM_WIN32(RPC_S_CALL_FAILED):
    case HRESULT_FROM_WIN32(RPC_S_CALL_FAILED_DNE):
    case RPC_E_DISCONNECTED:
    case E_NOINTERFACE: // the process that was starting for it went away
    // Wine's COM runtime in a server started beside another now and then
    // faults while it serves the client's first call; the server serves on.
    case HRESULT_FROM_WIN32(ERROR_NOACCESS):
        return true;
    default:
        return false;
    }
}

bool Connection::CreationAbandoned()
{
    return g_abandoned;
}

int Connection::Open(const std::wstring &name, double timeoutSeconds, Output &out)
{
    CLSID clsid;
    HRESULT hr = name.size() > 0 && name[0] == L'{' ? CLSIDFromString(name.c_str(), &clsid)
                                                    : CLSIDFromProgID(name.c_str(), &clsid);
    if (FAILED(hr)) {
        out.Error(L"no OPC server is registered as \"" + name + L"\"");
        return kExitNoServer;
    }
    ComPtr<IUnknown> object;
    hr = CreateOutOfProcess(clsid, IID_IOPCServer, L"", timeoutSeconds, object);
    if (hr == E_PENDING) {
        out.Error(L"the OPC server \"" + name + L"\" did not answer within " +
                  std::to_wstring(static_cast<long>(timeoutSeconds)) + L" s");
        return kExitNoServer;
    }
    if (SUCCEEDED(hr))
        hr = object.As(m_server);
    if (FAILED(hr)) {
        out.Error(L"cannot reach the OPC server \"" + name + L"\": " + SystemErrorText(hr) + L" (" + HexCode(hr) +
                  L")");
        return kExitNoServer;
    }
    ComPtr<IOPCCommon> common;
    if (SUCCEEDED(m_server.As(common)))
        common->SetClientName(L"opc");
    return kExitOk;
}

std::wstring SystemErrorText(HRESULT code)
{
    wchar_t *text = nullptr;
    DWORD n =
        FormatMessageW(FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                       nullptr, static_cast<DWORD>(code), 0, reinterpret_cast<wchar_t *>(&text), 0, nullptr);
    std::wstring result = n && text ? text : L"";
    LocalFree(text);
    while (!result.empty() &&
           (result.back() == L'\n' || result.back() == L'\r' || result.back() == L' ' || result.back() == L'.'))
        result.pop_back();
    return result.empty() ? L"unknown error" : result;
}

std::wstring Connection::Describe(HRESULT code) const
{
    std::wstring text;
    LPWSTR raw = nullptr;
    if (m_server && SUCCEEDED(m_server->GetErrorString(code, LOCALE_SYSTEM_DEFAULT, &raw)) && raw) {
        TaskMem<wchar_t> owned(raw);
        text = raw;
        while (!text.empty() && (text.back() == L'\n' || text.back() == L'\r' || text.back() == L' '))
            text.pop_back();
    }
    if (text.empty())
        text = SystemErrorText(code);
    return text + L" (" + HexCode(code) + L")";
}

ItemGroup::~ItemGroup()
{
    if (!m_items)
        return;
    m_items.Reset();
    m_server->RemoveGroup(m_handle, FALSE);
}

HRESULT ItemGroup::Create(IOPCServer *server, DWORD rate, bool active, float deadband, DWORD *revisedRate)
{
    DWORD revised = 0;
    HRESULT hr = server->AddGroup(L"", active ? TRUE : FALSE, rate, 0, nullptr, &deadband, 0, &m_handle, &revised,
                                  IID_IOPCItemMgt, reinterpret_cast<IUnknown **>(m_items.Out()));
    if (SUCCEEDED(hr))
        m_server = server;
    if (revisedRate)
        *revisedRate = revised;
    return hr;
}

HRESULT ItemGroup::Activate()
{
    ComPtr<IOPCGroupStateMgt> state;
    HRESULT hr = m_items.As(state);
    BOOL active = TRUE;
    DWORD revised = 0;
    return SUCCEEDED(hr) ? state->SetState(nullptr, &revised, &active, nullptr, nullptr, nullptr, nullptr) : hr;
}

HRESULT ItemGroup::Add(const std::vector<std::wstring> &ids, VARTYPE requested, std::vector<Item> &items)
{
    return AddOrValidate(ids, requested, false, items);
}

HRESULT ItemGroup::Validate(const std::vector<std::wstring> &ids, std::vector<Item> &items)
{
    return AddOrValidate(ids, VT_EMPTY, true, items);
}

HRESULT ItemGroup::AddOrValidate(const std::vector<std::wstring> &ids, VARTYPE requested, bool validateOnly,
                                 std::vector<Item> &items)
{
    std::vector<OPCITEMDEF> defs(ids.size());
    for (size_t i = 0; i < ids.size(); ++i) {
        defs[i] = {};
        defs[i].szAccessPath = const_cast<wchar_t *>(L"");
        defs[i].szItemID = const_cast<wchar_t *>(ids[i].c_str());
        defs[i].bActive = TRUE;
        defs[i].hClient = static_cast<OPCHANDLE>(i);
        defs[i].vtRequestedDataType = requested;
    }
    OPCITEMRESULT *rawResults = nullptr;
    HRESULT *rawErrors = nullptr;
    DWORD count = static_cast<DWORD>(defs.size());
    HRESULT hr = validateOnly ? m_items->ValidateItems(count, defs.data(), FALSE, &rawResults, &rawErrors)
                              : m_items->AddItems(count, defs.data(), &rawResults, &rawErrors);
    TaskMem<OPCITEMRESULT> results(rawResults);
    TaskMem<HRESULT> errors(rawErrors);
    items.assign(ids.size(), Item());
    for (size_t i = 0; i < ids.size(); ++i) {
        items[i].id = ids[i];
        items[i].error = errors ? errors[i] : hr;
        if (results) {
            CoTaskMemFree(results[i].pBlob);
            if (SUCCEEDED(items[i].error)) {
                items[i].server = results[i].hServer;
                items[i].canonical = results[i].vtCanonicalDataType;
                items[i].access = results[i].dwAccessRights;
            }
        }
    }
    return hr;
}

void ItemGroup::Valid(const std::vector<Item> &items, std::vector<OPCHANDLE> &servers, std::vector<size_t> &which)
{
    for (size_t i = 0; i < items.size(); ++i)
        if (SUCCEEDED(items[i].error)) {
            servers.push_back(items[i].server);
            which.push_back(i);
        }
}
