#pragma once
// The command line of opc: a subcommand, its positional arguments and its
// options ("--name value", "--name=value" or a bare "--flag").
#include <map>
#include <string>
#include <vector>

class Arguments {
public:
    // Options that take a value; every other option is a flag.
    static const std::vector<std::wstring> &ValueOptions();

    // Parses argv after the program name; false with error set when an
    // option lacks its value.
    bool Parse(const std::vector<std::wstring> &argv, std::wstring &error);

    const std::wstring &Command() const { return m_command; }
    const std::vector<std::wstring> &Positional() const { return m_positional; }
    bool Has(const std::wstring &option) const { return m_options.count(option) != 0; }
    std::wstring Value(const std::wstring &option, const std::wstring &fallback = L"") const;
    // Options given that the command does not know, or empty.
    std::wstring Unknown(const std::vector<std::wstring> &known) const;

private:
    std::wstring m_command;
    std::vector<std::wstring> m_positional;
    std::map<std::wstring, std::wstring> m_options;
};

// Parses a whole decimal number in [low, high]; false otherwise.
bool ParseNumber(const std::wstring &text, double low, double high, double &out);
