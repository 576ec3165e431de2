// opc read and opc write: synchronous reads and writes through a group of
// their own.
#include "Commands.h"
#include "Format.h"
#include "ItemLine.h"
#include "TaskMem.h"
#include "Variant.h"

#include <functional>

namespace {
// What opc says about each item, said in the order of the arguments once
// every answer is in (errors of AddItems, of the value, of the call).
class ItemReports {
public:
    explicit ItemReports(size_t count) : m_say(count) {}
    void Set(size_t i, std::function<void()> say) { m_say[i] = std::move(say); }
    void Say()
    {
        for (auto &say : m_say)
            if (say)
                say();
    }

private:
    std::vector<std::function<void()>> m_say;
};

// Adds the items and records those the server refused. False when none was
// added (the reason is reported unless it is the items' own).
bool AddItems(const std::vector<std::wstring> &ids, VARTYPE requested, ItemGroup &group,
              std::vector<ItemGroup::Item> &items, const wchar_t *verb, Output &out, Connection &server,
              ItemReports &reports, bool &failed)
{
    HRESULT hr = group.Create(server.Server(), 1000, true, 0);
    if (SUCCEEDED(hr))
        hr = group.Add(ids, requested, items);
    if (FAILED(hr) && hr != S_FALSE && items.empty()) {
        out.Error(std::wstring(verb) + L": " + server.Describe(hr));
        failed = true;
        return false;
    }
    bool any = false;
    for (size_t i = 0; i < items.size(); ++i) {
        if (FAILED(items[i].error)) {
            HRESULT error = items[i].error;
            std::wstring id = items[i].id;
            reports.Set(i, [&out, &server, verb, id, error] { ReportItemError(out, server, verb, id, error); });
            failed = true;
        } else {
            any = true;
        }
    }
    return any;
}

// The text of a value to write, converted to type in the invariant format.
HRESULT ToValue(const std::wstring &text, VARTYPE type, VARIANT *value)
{
    CVariant source;
    V_VT(source.Get()) = VT_BSTR;
    V_BSTR(source.Get()) = SysAllocStringLen(text.data(), static_cast<UINT>(text.size()));
    if (!V_BSTR(source.Get()))
        return E_OUTOFMEMORY;
    if (type == VT_EMPTY || type == VT_BSTR)
        return VariantCopy(value, source.Get());
    if (type == VT_BOOL && (_wcsicmp(text.c_str(), L"true") == 0 || _wcsicmp(text.c_str(), L"false") == 0)) {
        V_VT(value) = VT_BOOL;
        V_BOOL(value) = _wcsicmp(text.c_str(), L"true") == 0 ? VARIANT_TRUE : VARIANT_FALSE;
        return S_OK;
    }
    return VariantChangeTypeEx(value, source.Get(), LOCALE_INVARIANT, 0, type);
}
} // namespace

bool RequestedType(const Arguments &args, Output &out, VARTYPE &type)
{
    type = VT_EMPTY;
    if (!args.Has(L"type"))
        return true;
    if (ParseTypeName(args.Value(L"type"), type))
        return true;
    out.Error(L"unknown type \"" + args.Value(L"type") +
              L"\" (bool, int8..int64, uint8..uint64, float, double, "
              L"currency, date, string)");
    return false;
}

bool CheckRead(const Arguments &args, Output &out)
{
    VARTYPE requested;
    if (!RequestedType(args, out, requested))
        return false;
    std::wstring source = args.Value(L"source", L"cache");
    if (source != L"cache" && source != L"device") {
        out.Error(L"--source takes cache or device, not \"" + source + L"\"");
        return false;
    }
    if (args.Positional().empty()) {
        out.Error(L"read needs at least one item (see opc read --help)");
        return false;
    }
    return true;
}

int ReadItems(const Arguments &args, Output &out, Connection &server)
{
    VARTYPE requested;
    RequestedType(args, out, requested);
    std::wstring source = args.Value(L"source", L"cache");
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    ItemReports reports(args.Positional().size());
    bool failed = false;
    bool any = AddItems(args.Positional(), requested, group, items, L"read", out, server, reports, failed);
    if (!any) {
        reports.Say();
        return kExitFailed;
    }
    std::vector<OPCHANDLE> handles;
    std::vector<size_t> which;
    ItemGroup::Valid(items, handles, which);
    ComPtr<IOPCSyncIO> io;
    group.As(io);
    OPCITEMSTATE *rawStates = nullptr;
    HRESULT *rawErrors = nullptr;
    HRESULT hr = io ? io->Read(source == L"device" ? OPC_DS_DEVICE : OPC_DS_CACHE, static_cast<DWORD>(handles.size()),
                               handles.data(), &rawStates, &rawErrors)
                    : E_NOINTERFACE;
    TaskMem<OPCITEMSTATE> states(rawStates);
    TaskMem<HRESULT> errors(rawErrors);
    if (FAILED(hr) || !states || !errors) {
        reports.Say();
        out.Error(L"read: " + server.Describe(FAILED(hr) ? hr : E_FAIL));
        return kExitFailed;
    }
    for (size_t i = 0; i < handles.size(); ++i) {
        CVariant value;
        *value.Get() = states[i].vDataValue; // owned from here on
        const std::wstring &id = items[which[i]].id;
        HRESULT error = errors[i];
        if (FAILED(error)) {
            reports.Set(which[i], [&out, &server, id, error] { ReportItemError(out, server, L"read", id, error); });
            failed = true;
            continue;
        }
        std::wstring line = ItemValueLine(out.Json(), id, value.Value(), states[i].wQuality, states[i].ftTimeStamp);
        reports.Set(which[i], [&out, line] { out.Line(line); });
    }
    reports.Say();
    return failed ? kExitFailed : kExitOk;
}

bool CheckWrite(const Arguments &args, Output &out)
{
    VARTYPE type;
    if (!RequestedType(args, out, type))
        return false;
    if (args.Positional().empty() || args.Positional().size() % 2 != 0) {
        out.Error(L"write needs ITEM VALUE pairs (see opc write --help)");
        return false;
    }
    return true;
}

int WriteItems(const Arguments &args, Output &out, Connection &server)
{
    VARTYPE type;
    RequestedType(args, out, type);
    const auto &pairs = args.Positional();
    std::vector<std::wstring> ids, texts;
    for (size_t i = 0; i < pairs.size(); i += 2) {
        ids.push_back(pairs[i]);
        texts.push_back(pairs[i + 1]);
    }
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    ItemReports reports(ids.size());
    bool failed = false;
    if (!AddItems(ids, VT_EMPTY, group, items, L"write", out, server, reports, failed)) {
        reports.Say();
        return kExitFailed;
    }

    std::vector<OPCHANDLE> handles;
    std::vector<size_t> which;
    std::vector<CVariant> values(items.size());
    for (size_t i = 0; i < items.size(); ++i) {
        if (FAILED(items[i].error))
            continue;
        VARTYPE target = type != VT_EMPTY ? type : items[i].canonical;
        if (FAILED(ToValue(texts[i], target, values[i].Get()))) {
            std::wstring message =
                L"write " + ids[i] + L": \"" + texts[i] + L"\" is no " + TypeName(target) + L" value";
            reports.Set(i, [&out, message] { out.Error(message); });
            failed = true;
            continue;
        }
        handles.push_back(items[i].server);
        which.push_back(i);
    }
    if (handles.empty()) {
        reports.Say();
        return kExitFailed;
    }
    std::vector<VARIANT> sent;
    for (size_t i : which)
        sent.push_back(values[i].Value());
    ComPtr<IOPCSyncIO> io;
    group.As(io);
    HRESULT *rawErrors = nullptr;
    HRESULT hr =
        io ? io->Write(static_cast<DWORD>(handles.size()), handles.data(), sent.data(), &rawErrors) : E_NOINTERFACE;
    TaskMem<HRESULT> errors(rawErrors);
    if (FAILED(hr) || !errors) {
        reports.Say();
        out.Error(L"write: " + server.Describe(FAILED(hr) ? hr : E_FAIL));
        return kExitFailed;
    }
    for (size_t k = 0; k < which.size(); ++k) {
        const std::wstring &id = ids[which[k]];
        HRESULT error = errors[k];
        if (FAILED(error)) {
            reports.Set(which[k], [&out, &server, id, error] { ReportItemError(out, server, L"write", id, error); });
            failed = true;
        } else if (out.Json()) {
            std::wstring line = Output::Object({{L"item", JsonString(id)}, {L"written", ValueJson(sent[k])}});
            reports.Set(which[k], [&out, line] { out.Line(line); });
        } else {
            std::wstring line = id + L" = " + ValueText(sent[k]);
            reports.Set(which[k], [&out, line] { out.Line(line); });
        }
    }
    reports.Say();
    return failed ? kExitFailed : kExitOk;
}
