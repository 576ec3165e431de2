#pragma once
// Exceptions of the support code: a message, a code, a source name and a line.
#include <exception>

namespace tw::hmx::exception {

class Exception : public std::exception {
public:
    Exception(const char *source = "", int line = 0) : m_source(source), m_line(line) {}
    ~Exception() override = default;
    virtual const char *message() const { return "unspecified exception"; }
    virtual long code() const { return -1; }
    const char *what() const noexcept override { return message(); }
    const char *source() const { return m_source; }
    int line() const { return m_line; }

private:
    const char *m_source;
    int m_line;
};

class InvalidLocale : public Exception {
public:
    using Exception::Exception;
    const char *message() const override { return "Invalid locale."; }
    long code() const override { return static_cast<long>(0x8ABC7024); }
};

class LibraryNotLoaded : public Exception {
public:
    using Exception::Exception;
    const char *message() const override { return "Failed to load library"; }
    long code() const override { return static_cast<long>(0x8ABC7021); }
};

} // namespace tw::hmx::exception
