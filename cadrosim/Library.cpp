// The library objects of CDREALT and CDBROW and the engine's entry points,
// which the five vendor-named DLLs forward to.
#include "CadroSim.h"
#include "Engine.h"
#include "TextObject.h"

namespace cadrosim {
namespace {

class CRealTime : public CSimUnknown<CadroRealTime> {
public:
    explicit CRealTime(ICadroRealTimeReceiver *receiver) : m_receiver(receiver)
    {
        m_receiver->AddRef();
        Engine::Instance().AddUse();
    }
    ~CRealTime() override
    {
        m_receiver->Release();
        Engine::Instance().ReleaseUse();
    }

    HRESULT STDMETHODCALLTYPE Subscribe(const wchar_t *url, void *cookie, const SubscribeOptions *options,
                                        CadroDataItem **out) override
    {
        if (!options)
            return E_POINTER;
        return Engine::Instance().Subscribe(url, cookie, m_receiver, out);
    }

private:
    ICadroRealTimeReceiver *m_receiver;
};

class CBrowser : public CSimUnknown<CadroBrowser> {
public:
    explicit CBrowser(ICadroBrowserReceiver *receiver) : m_receiver(receiver)
    {
        Engine::Instance().AddUse();
        Engine::Instance().AddBrowserReceiver(m_receiver);
    }
    ~CBrowser() override
    {
        Engine::Instance().RemoveBrowserReceiver(m_receiver);
        Engine::Instance().ReleaseUse();
    }

    HRESULT STDMETHODCALLTYPE Open(const wchar_t *url) override
    {
        m_entries.clear();
        m_next = 0;
        if (!url)
            return E_POINTER;
        return Engine::Instance().Browse(url, m_entries) ? S_OK : HRESULT_FROM_WIN32(ERROR_NOT_FOUND);
    }

    HRESULT STDMETHODCALLTYPE Next(uint32_t fieldMask, BrowseRecord *record) override
    {
        if (!record)
            return E_POINTER;
        *record = {};
        if (m_next >= m_entries.size())
            return HRESULT_FROM_WIN32(ERROR_NO_MORE_ITEMS);
        const BrowseEntry &e = m_entries[m_next++];
        record->mask = fieldMask & kBrowseFieldMask;
        if (fieldMask & kBrowseName)
            record->name = SysAllocString(e.name.c_str());
        record->kind = e.kind;
        record->flags = e.leaf ? 1 : 0;
        size_t dash = e.name.find(L'-');
        record->description = SysAllocString(dash == std::wstring::npos ? L"" : e.name.c_str() + dash + 1);
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
    *out = SysAllocString(Engine::Instance().HostName().c_str());
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
    std::wstring text = Engine::Instance().Execute(command);
    *answer = SysAllocStringLen(text.data(), static_cast<UINT>(text.size()));
    return text.compare(0, 2, L"ok") == 0 ? S_OK : S_FALSE;
}

HRESULT CadroSim_Load(const wchar_t *description, BSTR *error)
{
    if (!description)
        return E_POINTER;
    std::wstring why;
    if (Engine::Instance().Load(description, why))
        return S_OK;
    if (error)
        *error = SysAllocString(why.c_str());
    return E_INVALIDARG;
}
