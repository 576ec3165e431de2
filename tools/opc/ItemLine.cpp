#include "ItemLine.h"

#include "Format.h"

#include <cwchar>

std::wstring ItemValueLine(bool json, const std::wstring &id, const VARIANT &value, WORD quality, const FILETIME &time)
{
    if (json)
        return Output::Object({{L"item", JsonString(id)},
                               {L"value", ValueJson(value)},
                               {L"type", JsonString(TypeName(V_VT(&value)))},
                               {L"quality", std::to_wstring(quality)},
                               {L"qualityText", JsonString(QualityText(quality))},
                               {L"timestamp", JsonString(LocalTimeText(time))}});
    std::wstring line = id;
    line.resize(std::max<size_t>(line.size() + 2, 36), L' ');
    std::wstring valueText = ValueText(value);
    line += valueText;
    line.resize(std::max(line.size() + 2, size_t(36 + 18)), L' ');
    line += TypeName(V_VT(&value));
    line.resize(std::max(line.size() + 2, size_t(36 + 18 + 9)), L' ');
    line += QualityText(quality);
    line.resize(std::max(line.size() + 2, size_t(36 + 18 + 9 + 10)), L' ');
    return line + LocalTimeText(time);
}

void ReportItemError(Output &out, const Connection &server, const wchar_t *verb, const std::wstring &id, HRESULT error)
{
    std::wstring message = server.Describe(error);
    if (out.Json())
        out.Line(Output::Object(
            {{L"item", JsonString(id)}, {L"error", JsonString(HexCode(error))}, {L"message", JsonString(message)}}));
    else
        out.Error(std::wstring(verb) + L" " + id + L": " + message);
}
