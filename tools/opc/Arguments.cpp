#include "Arguments.h"

#include <algorithm>
#include <cwchar>
#include <cwctype>

namespace {
// Short spellings of the common options.
std::wstring LongName(const std::wstring &option)
{
    if (option == L"-h")
        return L"help";
    if (option == L"-s")
        return L"server";
    if (option == L"-j")
        return L"json";
    if (option == L"-t")
        return L"timeout";
    return option.substr(2);
}
} // namespace

const std::vector<std::wstring> &Arguments::ValueOptions()
{
    static const std::vector<std::wstring> options = {L"server",   L"source",   L"type",    L"rate",
                                                      L"duration", L"count",    L"filter",  L"access",
                                                      L"depth",    L"deadband", L"timeout", L"host"};
    return options;
}

bool Arguments::Parse(const std::vector<std::wstring> &argv, std::wstring &error)
{
    const auto &valued = ValueOptions();
    bool optionsEnd = false;
    for (size_t i = 0; i < argv.size(); ++i) {
        const std::wstring &arg = argv[i];
        bool isOption = !optionsEnd && arg.size() >= 2 && arg[0] == L'-' &&
                        (arg[1] == L'-' || (arg.size() == 2 && std::iswalpha(arg[1])));
        if (!optionsEnd && arg == L"--") {
            optionsEnd = true;
            continue;
        }
        if (!isOption) {
            if (m_command.empty())
                m_command = arg;
            else
                m_positional.push_back(arg);
            continue;
        }
        std::wstring name = LongName(arg), value;
        size_t equals = name.find(L'=');
        bool inlineValue = arg[1] == L'-' && equals != std::wstring::npos;
        if (inlineValue) {
            value = name.substr(equals + 1);
            name.resize(equals);
        }
        if (std::find(valued.begin(), valued.end(), name) != valued.end() && !inlineValue) {
            if (i + 1 >= argv.size()) {
                error = L"option --" + name + L" needs a value";
                return false;
            }
            value = argv[++i];
        }
        m_options[name] = value;
    }
    return true;
}

std::wstring Arguments::Value(const std::wstring &option, const std::wstring &fallback) const
{
    auto it = m_options.find(option);
    return it == m_options.end() ? fallback : it->second;
}

std::wstring Arguments::Unknown(const std::vector<std::wstring> &known) const
{
    for (const auto &option : m_options)
        if (std::find(known.begin(), known.end(), option.first) == known.end())
            return L"--" + option.first;
    return L"";
}

bool ParseNumber(const std::wstring &text, double low, double high, double &out)
{
    if (text.empty())
        return false;
    wchar_t *end = nullptr;
    double value = wcstod(text.c_str(), &end);
    if (!end || *end != L'\0' || !(value >= low && value <= high))
        return false;
    out = value;
    return true;
}
