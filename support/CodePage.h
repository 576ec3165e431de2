#pragma once
// Wide text to and from 8-bit text in the system (ANSI) code page.
#include <windows.h>

#include <string>

// substitute replaces characters the code page lacks (null: the system's choice).
inline std::string ToCodePage(const std::wstring &text, const char *substitute = nullptr)
{
    int n = WideCharToMultiByte(CP_ACP, 0, text.c_str(), -1, nullptr, 0, substitute, nullptr);
    std::string out(n > 0 ? n - 1 : 0, '\0');
    if (n > 1)
        WideCharToMultiByte(CP_ACP, 0, text.c_str(), -1, out.data(), n, substitute, nullptr);
    return out;
}

inline std::wstring FromCodePage(const char *text)
{
    int n = MultiByteToWideChar(CP_ACP, 0, text, -1, nullptr, 0);
    std::wstring out(n > 0 ? n - 1 : 0, L'\0');
    if (n > 1)
        MultiByteToWideChar(CP_ACP, 0, text, -1, out.data(), n);
    return out;
}
