// The library objects of CDREALT and CDBROW and the engine's entry points,
// which the five vendor-named DLLs forward to.
#include "CadroSim.h"
#include "Engine.h"
#include "NodeLink.h"
#include "NodeServer.h"
#include "TextObject.h"

#include <atomic>

namespace cadrosim {
namespace {

// Where this process's network is: its own engine, or the machine's node
// (see Backend).
std::atomic<bool> g_embedded{false};

Backend &TheNetwork()
{
    if (g_embedded)
        return Engine::Instance();
    return NodeLink::Instance();
}

class CRealTime : public CSimUnknown<CadroRealTime> {
public:
    explicit CRealTime(ICadroRealTimeReceiver *receiver) : m_receiver(receiver)
    {
        m_receiver->AddRef();
        TheNetwork().AddUse();
    }
    ~CRealTime() override
    {
        m_receiver->Release();
        TheNetwork().ReleaseUse();
    }

    HRESULT STDMETHODCALLTYPE Subscribe(const wchar_t *url, void *cookie, const SubscribeOptions *options,
                                        CadroDataItem **out) override
    {
        if (!options)
            return E_POINTER;
        return TheNetwork().Subscribe(url, cookie, m_receiver, out);
    }

private:
    ICadroRealTimeReceiver *m_receiver;
};

class CBrowser : public CSimUnknown<CadroBrowser> {
public:
    explicit CBrowser(ICadroBrowserReceiver *receiver) : m_receiver(receiver)
    {
        TheNetwork().AddUse();
        TheNetwork().AddBrowserReceiver(m_receiver);
    }
    ~CBrowser() override
    {
        TheNetwork().RemoveBrowserReceiver(m_receiver);
        TheNetwork().ReleaseUse();
    }

    HRESULT STDMETHODCALLTYPE Open(const wchar_t *url) override
    {
        m_entries.clear();
        m_next = 0;
        if (!url)
            return E_POINTER;
        bool found = TheNetwork().Browse(url, m_entries);
        return found ? S_OK : HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
    }

    HRESULT STDMETHODCALLTYPE Next(uint32_t fieldMask, BrowseRecord *record) override
    {
        if (!record)
            return E_POINTER;
        *record = {};
        if (m_next >= m_entries.size()) {
            // A listing of a large object is not kept until the next one:
            // the browser lives as long as its address space.
            std::vector<BrowseEntry>().swap(m_entries);
            m_next = 0;
            return HRESULT_FROM_WIN32(ERROR_NO_MORE_ITEMS);
        }
        const BrowseEntry &e = m_entries[m_next++];
        record->mask = fieldMask & kBrowseFieldMask;
        if (fieldMask & kBrowseName)
            record->name = SysAllocString(e.name.c_str());
        record->kind = e.kind;
        record->flags = e.leaf ? 1 : 0;
        // Most members have no description: a null BSTR is the empty text,
        // and saves the caller a string made and freed for each record (a
        // lookup of thousands of items reads thousands of records).
        size_t dash = e.name.find(L'-');
        if (dash != std::wstring::npos)
            record->description = SysAllocString(e.name.c_str() + dash + 1);
        record->dataType = e.dataType;
        record->access = e.access;
        return S_OK;
    }

private:
    ICadroBrowserReceiver *m_receiver;
    std::vector<BrowseEntry> m_entries;
    size_t m_next = 0;
};

} // namespace
} // namespace cadrosim

using namespace cadrosim;

bool CadroSim_NewRealTime(ICadroRealTimeReceiver *receiver, CadroRealTime **out)
{
    if (!out)
        return false;
    *out = receiver ? new (std::nothrow) CRealTime(receiver) : nullptr;
    return *out != nullptr;
}

bool CadroSim_NewBrowser(ICadroBrowserReceiver *receiver, CadroBrowser **out)
{
    if (!out)
        return false;
    *out = receiver ? new (std::nothrow) CBrowser(receiver) : nullptr;
    return *out != nullptr;
}

HRESULT CadroSim_HostName(BSTR *out)
{
    if (!out)
        return E_POINTER;
    // The engine, here or in the node, runs on this machine.
    *out = SysAllocString(LocalHostName().c_str());
    return *out ? S_OK : E_OUTOFMEMORY;
}

IUnknown *CadroSim_NewWideText(const wchar_t *text)
{
    return text ? NewWideText(text) : nullptr;
}

HRESULT CadroSim_Execute(const wchar_t *command, BSTR *answer)
{
    if (!command || !answer)
        return E_POINTER;
    std::wstring text = TheNetwork().Execute(command);
    *answer = SysAllocStringLen(text.data(), static_cast<UINT>(text.size()));
    return text.compare(0, 2, L"ok") == 0 ? S_OK : S_FALSE;
}

HRESULT CadroSim_Load(const wchar_t *description, BSTR *error)
{
    if (!description)
        return E_POINTER;
    std::wstring why;
    bool loaded = TheNetwork().Load(description, why);
    if (loaded)
        return S_OK;
    if (error)
        *error = SysAllocString(why.c_str());
    return E_INVALIDARG;
}

void CadroSim_UseEmbeddedNetwork()
{
    g_embedded = true;
}

int CadroSim_RunNode(unsigned long idleSeconds, const wchar_t *name, const wchar_t *listen)
{
    g_embedded = true;
    NodeServer *node = NodeServer::Create(Engine::Instance(), idleSeconds * 1000, name ? name : wire::kNodeName,
                                          listen ? listen : L"");
    if (!node)
        return 1;
    int code = node->Run();
    node->Release();
    return code;
}

HRESULT CadroSim_StopNode()
{
    // The node's pid is not known here: its control pipe is found by name
    // through the node pipe's server process.
    HANDLE pipe =
        CreateFileW(wire::NodePipeName(), GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
    if (pipe == INVALID_HANDLE_VALUE)
        return S_FALSE;
    ULONG pid = 0;
    GetNamedPipeServerProcessId(pipe, &pid);
    CloseHandle(pipe);
    HANDLE process = pid ? OpenProcess(SYNCHRONIZE, FALSE, pid) : nullptr;
    wchar_t answer[256];
    DWORD got = 0;
    std::wstring control = ControlPipeName(pid);
    wchar_t command[] = L"shutdown";
    BOOL sent =
        CallNamedPipeW(control.c_str(), command, sizeof command - sizeof(wchar_t), answer, sizeof answer, &got, 5000);
    DWORD waited = process ? WaitForSingleObject(process, 15000) : WAIT_FAILED;
    if (process)
        CloseHandle(process);
    return sent && waited == WAIT_OBJECT_0 ? S_OK : E_FAIL;
}
