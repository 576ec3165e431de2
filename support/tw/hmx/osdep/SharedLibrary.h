#pragma once
// One dynamically loaded library.
#include <windows.h>

#include <string>

namespace tw::hmx::osdep {

class SharedLibrary {
public:
    SharedLibrary() = default;
    // Loads path unless it is empty; a failure leaves it unloaded.
    explicit SharedLibrary(const std::string &path);
    virtual ~SharedLibrary();
    SharedLibrary(const SharedLibrary &) = delete;
    SharedLibrary &operator=(const SharedLibrary &) = delete;

    void Swap(SharedLibrary &other);
    bool IsLoaded() const { return m_module != nullptr; }
    // The symbol, or null when optional; a required symbol that cannot be
    // found raises WinError.
    FARPROC GetSymbol(const char *name, bool optional = false) const;

private:
    std::string m_path;
    HMODULE m_module = nullptr;
};

} // namespace tw::hmx::osdep
