// opc read and opc write: synchronous reads and writes through a group of
// their own.
#include "Commands.h"
#include "Format.h"
#include "ItemLine.h"
#include "TaskMem.h"
#include "Variant.h"

namespace {
// Adds the items; reports those the server refused. False when none was added.
bool AddItems(const std::vector<std::wstring> &ids, VARTYPE requested, ItemGroup &group,
              std::vector<ItemGroup::Item> &items, const wchar_t *verb, Output &out, Connection &server, bool &failed)
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
    for (const ItemGroup::Item &item : items) {
        if (FAILED(item.error)) {
            ReportItemError(out, server, verb, item.id, item.error);
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

int ReadItems(const Arguments &args, Output &out, Connection &server)
{
    VARTYPE requested;
    if (!RequestedType(args, out, requested))
        return kExitUsage;
    std::wstring source = args.Value(L"source", L"cache");
    if (source != L"cache" && source != L"device") {
        out.Error(L"--source takes cache or device, not \"" + source + L"\"");
        return kExitUsage;
    }
    if (args.Positional().empty()) {
        out.Error(L"read needs at least one item (see opc read --help)");
        return kExitUsage;
    }
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    bool failed = false;
    if (!AddItems(args.Positional(), requested, group, items, L"read", out, server, failed))
        return kExitFailed;
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
        out.Error(L"read: " + server.Describe(FAILED(hr) ? hr : E_FAIL));
        return kExitFailed;
    }
    for (size_t i = 0; i < handles.size(); ++i) {
        CVariant value;
        *value.Get() = states[i].vDataValue; // owned from here on
        if (FAILED(errors[i])) {
            ReportItemError(out, server, L"read", items[which[i]].id, errors[i]);
            failed = true;
            continue;
        }
        out.Line(
            ItemValueLine(out.Json(), items[which[i]].id, value.Value(), states[i].wQuality, states[i].ftTimeStamp));
    }
    return failed ? kExitFailed : kExitOk;
}

int WriteItems(const Arguments &args, Output &out, Connection &server)
{
    VARTYPE type;
    if (!RequestedType(args, out, type))
        return kExitUsage;
    const auto &pairs = args.Positional();
    if (pairs.empty() || pairs.size() % 2 != 0) {
        out.Error(L"write needs ITEM VALUE pairs (see opc write --help)");
        return kExitUsage;
    }
    std::vector<std::wstring> ids, texts;
    for (size_t i = 0; i < pairs.size(); i += 2) {
        ids.push_back(pairs[i]);
        texts.push_back(pairs[i + 1]);
    }
    ItemGroup group;
    std::vector<ItemGroup::Item> items;
    bool failed = false;
    if (!AddItems(ids, VT_EMPTY, group, items, L"write", out, server, failed))
        return kExitFailed;

    std::vector<OPCHANDLE> handles;
    std::vector<size_t> which;
    std::vector<CVariant> values(items.size());
    for (size_t i = 0; i < items.size(); ++i) {
        if (FAILED(items[i].error))
            continue;
        HRESULT hr = ToValue(texts[i], type != VT_EMPTY ? type : items[i].canonical, values[i].Get());
        if (FAILED(hr)) {
            out.Error(L"write " + ids[i] + L": \"" + texts[i] + L"\" is no " +
                      TypeName(type != VT_EMPTY ? type : items[i].canonical) + L" value");
            failed = true;
            continue;
        }
        handles.push_back(items[i].server);
        which.push_back(i);
    }
    if (handles.empty())
        return kExitFailed;
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
        out.Error(L"write: " + server.Describe(FAILED(hr) ? hr : E_FAIL));
        return kExitFailed;
    }
    for (size_t k = 0; k < which.size(); ++k) {
        const std::wstring &id = ids[which[k]];
        if (FAILED(errors[k])) {
            ReportItemError(out, server, L"write", id, errors[k]);
            failed = true;
        } else if (out.Json()) {
            out.Line(Output::Object({{L"item", JsonString(id)}, {L"written", ValueJson(sent[k])}}));
        } else {
            out.Line(id + L" = " + ValueText(sent[k]));
        }
    }
    return failed ? kExitFailed : kExitOk;
}
