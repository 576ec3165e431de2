#include "SimValue.h"

#include "TextObject.h"

#include <cmath>
#include <cwchar>
#include <cwctype>

namespace cadrosim {

SimValue SimValue::Number(uint32_t type, double n)
{
    SimValue v;
    v.type = type;
    v.number = n;
    return v;
}

SimValue SimValue::Text(uint32_t type, std::wstring s)
{
    SimValue v;
    v.type = type;
    v.text = std::move(s);
    return v;
}

uint32_t TypeFromName(const std::wstring &name)
{
    if (name == L"bool" || name == L"boolean")
        return kCadroBoolean;
    if (name == L"number")
        return kCadroNumber;
    if (name == L"text")
        return kCadroNarrowText;
    if (name == L"wtext")
        return kCadroWideText;
    if (name == L"none")
        return kCadroCleared;
    return 0;
}

const wchar_t *TypeName(uint32_t type)
{
    switch (type) {
    case kCadroBoolean:
        return L"bool";
    case kCadroNumber:
        return L"number";
    case kCadroNarrowText:
        return L"text";
    case kCadroWideText:
        return L"wtext";
    default:
        return L"none";
    }
}

namespace {
bool ParseNumber(const std::wstring &s, double &out)
{
    if (s.empty())
        return false;
    wchar_t *end = nullptr;
    out = wcstod(s.c_str(), &end);
    return end && *end == L'\0' && std::isfinite(out);
}

std::wstring Lower(std::wstring s)
{
    for (auto &c : s)
        c = static_cast<wchar_t>(towlower(c));
    return s;
}
} // namespace

bool ParseValue(uint32_t type, const std::wstring &literal, SimValue &out)
{
    switch (type) {
    case kCadroBoolean: {
        std::wstring l = Lower(literal);
        double n;
        if (l == L"true" || l == L"on" || l == L"yes")
            out = SimValue::Number(type, 1);
        else if (l == L"false" || l == L"off" || l == L"no")
            out = SimValue::Number(type, 0);
        else if (ParseNumber(l, n))
            out = SimValue::Number(type, n != 0 ? 1 : 0);
        else
            return false;
        return true;
    }
    case kCadroNumber: {
        double n;
        if (!ParseNumber(literal, n))
            return false;
        out = SimValue::Number(type, n);
        return true;
    }
    case kCadroNarrowText:
    case kCadroWideText:
        out = SimValue::Text(type, literal);
        return true;
    default:
        out = SimValue();
        return literal.empty();
    }
}

std::wstring FormatValue(const SimValue &value)
{
    switch (value.type) {
    case kCadroBoolean:
        return value.number != 0 ? L"true" : L"false";
    case kCadroNumber: {
        wchar_t text[64];
        swprintf(text, 64, L"%.15g", value.number);
        return text;
    }
    case kCadroNarrowText:
    case kCadroWideText:
        return value.text;
    default:
        return L"(no value)";
    }
}

SimValue FromNumber(uint32_t type, double n)
{
    switch (type) {
    case kCadroBoolean:
        return SimValue::Number(type, n != 0 ? 1 : 0);
    case kCadroNumber:
        return SimValue::Number(type, n);
    case kCadroNarrowText:
    case kCadroWideText:
        return SimValue::Text(type, FormatValue(SimValue::Number(kCadroNumber, n)));
    default:
        return SimValue();
    }
}

bool ToCadroValue(const SimValue &value, CadroValue &record)
{
    record.type = value.type;
    record.number = 0;
    switch (value.type) {
    case kCadroBoolean:
        record.boolean = value.number != 0 ? 1 : 0;
        return true;
    case kCadroNumber:
        record.number = value.number;
        return true;
    case kCadroWideText:
        record.text = value.text.empty() ? nullptr : NewWideText(value.text);
        return value.text.empty() || record.text;
    case kCadroNarrowText: {
        if (value.text.empty()) {
            record.text = nullptr;
            return true;
        }
        int n = WideCharToMultiByte(CP_ACP, 0, value.text.c_str(), -1, nullptr, 0, nullptr, nullptr);
        std::string narrow(n > 0 ? n - 1 : 0, '\0');
        if (n > 1)
            WideCharToMultiByte(CP_ACP, 0, value.text.c_str(), -1, narrow.data(), n, nullptr, nullptr);
        record.text = NewNarrowText(narrow);
        return record.text != nullptr;
    }
    default:
        record.type = kCadroCleared;
        return true;
    }
}

void ClearCadroValue(CadroValue &record)
{
    if ((record.type & kCadroTextBit) && record.text)
        record.text->Release();
    record.type = kCadroCleared;
    record.number = 0;
}

bool TextOf(const CadroValue &record, std::wstring &out)
{
    out.clear();
    if (!record.text)
        return true;
    if (record.type == kCadroWideText) {
        ICadroWideText *wide = nullptr;
        if (FAILED(record.text->QueryInterface(__uuidof(ICadroWideText), reinterpret_cast<void **>(&wide))))
            return false;
        out = wide->Chars();
        wide->Release();
        return true;
    }
    ICadroNarrowText *narrow = nullptr;
    if (FAILED(record.text->QueryInterface(__uuidof(ICadroNarrowText), reinterpret_cast<void **>(&narrow))))
        return false;
    const char *chars = narrow->Chars();
    int n = MultiByteToWideChar(CP_ACP, 0, chars, -1, nullptr, 0);
    out.assign(n > 0 ? n - 1 : 0, L'\0');
    if (n > 1)
        MultiByteToWideChar(CP_ACP, 0, chars, -1, out.data(), n);
    narrow->Release();
    return true;
}

bool FromCadroValue(const CadroValue &record, uint32_t memberType, SimValue &out)
{
    switch (record.type) {
    case kCadroNoValue:
    case kCadroCleared:
        // An empty text is sent as a record without a text object.
        if (memberType == kCadroNarrowText || memberType == kCadroWideText) {
            out = SimValue::Text(memberType, L"");
            return true;
        }
        out = SimValue();
        return memberType == kCadroCleared;
    case kCadroBoolean:
        out = FromNumber(memberType, record.boolean ? 1 : 0);
        return memberType != kCadroCleared;
    case kCadroNumber:
        if (!std::isfinite(record.number) && memberType != kCadroNumber)
            return false;
        out = FromNumber(memberType, record.number);
        return memberType != kCadroCleared;
    case kCadroNarrowText:
    case kCadroWideText: {
        std::wstring text;
        if (!TextOf(record, text))
            return false;
        return ParseValue(memberType, text, out) && memberType != kCadroCleared;
    }
    default:
        return false;
    }
}

} // namespace cadrosim
