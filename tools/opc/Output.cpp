#include "Output.h"

#include "Format.h"

#include <cstdio>
#include <mutex>

namespace {
std::mutex g_writeLock;

void Write(FILE *stream, const std::wstring &text)
{
    std::string bytes = Utf8(text + L"\n");
    std::lock_guard<std::mutex> hold(g_writeLock);
    fwrite(bytes.data(), 1, bytes.size(), stream);
    fflush(stream);
}
} // namespace

std::string Utf8(const std::wstring &text)
{
    int size =
        WideCharToMultiByte(CP_UTF8, 0, text.data(), static_cast<int>(text.size()), nullptr, 0, nullptr, nullptr);
    std::string bytes(size > 0 ? size : 0, '\0');
    if (size > 0)
        WideCharToMultiByte(CP_UTF8, 0, text.data(), static_cast<int>(text.size()), &bytes[0], size, nullptr, nullptr);
    return bytes;
}

void Output::Line(const std::wstring &text)
{
    Write(stdout, text);
}

void Output::Error(const std::wstring &text)
{
    Write(stderr, L"opc: " + text);
}

std::wstring Output::Object(const std::vector<std::pair<std::wstring, std::wstring>> &fields)
{
    std::wstring text = L"{";
    for (const auto &field : fields) {
        if (text.size() > 1)
            text += L",";
        text += JsonString(field.first) + L":" + field.second;
    }
    return text + L"}";
}
