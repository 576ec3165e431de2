#pragma once
// Operating-system failures: OSException with its own text, and WinError
// with the system's text for a Windows error code.
#include "../exception/Exception.h"

#include <windows.h>

#include <string>

namespace tw::hmx::osdep {

class OSException : public exception::Exception {
public:
    OSException(std::string text, unsigned long osError, const char *source = "", int line = 0)
        : Exception(source, line), m_text(std::move(text)), m_osError(osError)
    {
    }
    const char *message() const override { return m_text.c_str(); }
    long code() const override { return 42; }
    virtual unsigned long osError() const { return m_osError; }

private:
    std::string m_text;
    unsigned long m_osError;
};

class WinError : public OSException {
public:
    // From a message (empty: the system's text) and a Windows error code.
    WinError(std::string text, unsigned long code, const char *source = "", int line = 0);
    // From the calling thread's last Windows error.
    static WinError FromLastError(const char *source = "", int line = 0);
    long code() const override { return MapCode(osError()); }

    // The code a Windows error code maps to.
    static long MapCode(unsigned long windowsCode);
    // The system's text for a code: its first line without a final period,
    // or "Unknown error".
    static std::string SystemText(unsigned long windowsCode);
};

} // namespace tw::hmx::osdep
