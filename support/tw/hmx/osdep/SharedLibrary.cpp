#include "SharedLibrary.h"

#include "OSException.h"

#include <utility>

namespace tw::hmx::osdep {

SharedLibrary::SharedLibrary(const std::string &path) : m_path(path)
{
    if (!path.empty())
        m_module = LoadLibraryA(path.c_str());
}

SharedLibrary::~SharedLibrary()
{
    if (m_module)
        FreeLibrary(m_module);
}

void SharedLibrary::Swap(SharedLibrary &other)
{
    std::swap(m_path, other.m_path);
    std::swap(m_module, other.m_module);
}

FARPROC SharedLibrary::GetSymbol(const char *name, bool optional) const
{
    if (!m_module) {
        if (optional)
            return nullptr;
        throw WinError("library not loaded", 9999);
    }
    FARPROC symbol = GetProcAddress(m_module, name);
    if (!symbol && !optional)
        throw WinError::FromLastError("tw/hmx/osdep/SharedLibrary", 161);
    return symbol;
}

} // namespace tw::hmx::osdep
