#include "OSException.h"

namespace tw::hmx::osdep {

WinError WinError::FromLastError(const char *source, int line)
{
    return WinError("", GetLastError(), source, line);
}

WinError::WinError(std::string text, unsigned long code, const char *source, int line)
    : OSException(text.empty() ? SystemText(code) : std::move(text), code, source, line)
{
}

long WinError::MapCode(unsigned long windowsCode)
{
    switch (windowsCode) {
    case 0:
        return 0;
    case 2:
    case 3:
    case 15:
        return 7;
    case 4:
        return 11;
    case 5:
        return static_cast<long>(0x80070005);
    case 6:
    case 87:
        return 1;
    case 8:
    case 14:
        return 2;
    case 11:
        return 23;
    case 16:
    case 19:
    case 32:
    case 33:
        return 8;
    case 20:
        return 37;
    case 23:
        return -508;
    case 38:
        return 4;
    case 39:
        return 9;
    case 80:
        return -98;
    default:
        return 42;
    }
}

std::string WinError::SystemText(unsigned long windowsCode)
{
    char buffer[1024];
    DWORD n = FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS, nullptr, windowsCode,
                             MAKELANGID(LANG_NEUTRAL, SUBLANG_NEUTRAL), buffer, sizeof buffer, nullptr);
    if (n == 0)
        return "Unknown error";
    std::string text(buffer, n);
    size_t cr = text.find('\r');
    if (cr != std::string::npos) {
        text.erase(cr);
        if (!text.empty() && text.back() == '.')
            text.pop_back();
    }
    return text;
}

} // namespace tw::hmx::osdep
