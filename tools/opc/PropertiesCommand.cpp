// opc properties: every property the server has for an item, with its value.
#include "Commands.h"
#include "Format.h"
#include "ItemLine.h"
#include "TaskMem.h"
#include "Variant.h"

namespace {
// Properties whose numbers people read as names: the canonical data type
// (1) and the access rights (5).
std::wstring Explained(DWORD id, const VARIANT &value)
{
    CVariant number;
    if (FAILED(VariantChangeType(number.Get(), const_cast<VARIANT *>(&value), 0, VT_I4)))
        return L"";
    LONG n = V_I4(number.Get());
    if (id == 1)
        return L" (" + TypeName(static_cast<VARTYPE>(n)) + L")";
    if (id == 5)
        return n == 3 ? L" (read, write)" : n == 1 ? L" (read)" : n == 2 ? L" (write)" : L"";
    return L"";
}

// One item's properties; false when the server has none, or could read none.
bool PrintProperties(IOPCItemProperties *properties, const std::wstring &id, Output &out, const Connection &server)
{
    DWORD count = 0;
    DWORD *rawIds = nullptr;
    LPWSTR *rawDescriptions = nullptr;
    VARTYPE *rawTypes = nullptr;
    HRESULT hr = properties->QueryAvailableProperties(const_cast<wchar_t *>(id.c_str()), &count, &rawIds,
                                                      &rawDescriptions, &rawTypes);
    TaskMem<DWORD> ids(rawIds);
    TaskMem<LPWSTR> descriptions(rawDescriptions);
    TaskMem<VARTYPE> types(rawTypes);
    std::vector<TaskMem<wchar_t>> texts;
    for (DWORD i = 0; descriptions && i < count; ++i)
        texts.emplace_back(descriptions[i]);
    if (FAILED(hr)) {
        ReportItemError(out, server, L"properties", id, hr);
        return false;
    }
    VARIANT *rawValues = nullptr;
    HRESULT *rawErrors = nullptr;
    hr = properties->GetItemProperties(const_cast<wchar_t *>(id.c_str()), count, ids.Get(), &rawValues, &rawErrors);
    TaskMem<VARIANT> values(rawValues);
    TaskMem<HRESULT> errors(rawErrors);
    std::vector<CVariant> owned(values ? count : 0);
    for (DWORD i = 0; values && i < count; ++i)
        *owned[i].Get() = values[i];
    if (!out.Json())
        out.Line(id);
    DWORD readable = 0;
    for (DWORD i = 0; i < count; ++i) {
        HRESULT error = FAILED(hr) ? hr : errors ? errors[i] : E_FAIL;
        if (SUCCEEDED(error))
            ++readable;
        std::wstring description = texts[i].Get() ? texts[i].Get() : L"";
        std::wstring value =
            SUCCEEDED(error) && values ? (out.Json() ? ValueJson(owned[i].Value()) : ValueText(owned[i].Value())) : L"";
        if (out.Json()) {
            std::vector<std::pair<std::wstring, std::wstring>> fields = {{L"item", JsonString(id)},
                                                                         {L"id", std::to_wstring(ids[i])},
                                                                         {L"description", JsonString(description)},
                                                                         {L"type", JsonString(TypeName(types[i]))}};
            if (SUCCEEDED(error))
                fields.push_back({L"value", value});
            else
                fields.push_back({L"error", JsonString(HexCode(error))});
            out.Line(Output::Object(fields));
            continue;
        }
        wchar_t head[160];
        swprintf(head, 160, L"  %5lu  %-36ls %-9ls ", static_cast<unsigned long>(ids[i]), description.c_str(),
                 TypeName(types[i]).c_str());
        out.Line(head + (SUCCEEDED(error) ? value + Explained(ids[i], owned[i].Value())
                                          : L"(" + server.Describe(error) + L")"));
    }
    return count == 0 || readable > 0;
}
} // namespace

bool CheckProperties(const Arguments &args, Output &out)
{
    if (args.Positional().empty()) {
        out.Error(L"properties needs at least one item (see opc properties --help)");
        return false;
    }
    return true;
}

int ShowProperties(const Arguments &args, Output &out, Connection &server)
{
    ComPtr<IOPCItemProperties> properties;
    if (FAILED(ComPtr<IOPCServer>(server.Server()).As(properties))) {
        out.Error(L"properties: the server offers no item properties");
        return kExitFailed;
    }
    // The server lists the same properties for any identifier and fails
    // each of them for an unknown one (and ValidateItems accepts what the
    // address space lacks); adding the items to an inactive group finds the
    // real cause, said once per item.
    ItemGroup group;
    std::vector<ItemGroup::Item> known;
    if (FAILED(group.Create(server.Server(), 1000, false, 0)) || FAILED(group.Add(args.Positional(), VT_EMPTY, known)))
        known.clear();
    bool failed = false;
    for (size_t i = 0; i < args.Positional().size(); ++i) {
        const std::wstring &id = args.Positional()[i];
        if (i < known.size() && FAILED(known[i].error)) {
            ReportItemError(out, server, L"properties", id, known[i].error);
            failed = true;
        } else if (!PrintProperties(properties.Get(), id, out, server)) {
            failed = true;
        }
    }
    return failed ? kExitFailed : kExitOk;
}
