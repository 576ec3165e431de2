#pragma once
// Where opc writes: results to standard output, one line at a time (whole
// lines even when callbacks print from several threads), messages to standard
// error, both in UTF-8.
#include <windows.h>

#include <string>
#include <utility>
#include <vector>

class Output {
public:
    explicit Output(bool json) : m_json(json) {}
    bool Json() const { return m_json; }

    void Line(const std::wstring &text);
    // "opc: <text>" on standard error.
    void Error(const std::wstring &text);

    // A JSON object of already encoded values: {"name":value,...}.
    static std::wstring Object(const std::vector<std::pair<std::wstring, std::wstring>> &fields);

private:
    bool m_json;
};

// Text in UTF-8.
std::string Utf8(const std::wstring &text);
