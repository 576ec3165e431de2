#include "icu.h"

#include "../exception/Exception.h"

#include <atomic>
#include <cstdio>
#include <vector>

namespace tw::hmx::osdep {

namespace {
std::string IcuDirectory()
{
    HKEY key;
    if (RegOpenKeyExA(HKEY_LOCAL_MACHINE, "Software\\Tarnwell\\Common\\HMX Shared", 0, KEY_READ, &key) != ERROR_SUCCESS)
        return "";
    DWORD type = 0, size = 0;
    std::string dir;
    if (RegQueryValueExA(key, "icuDir", nullptr, &type, nullptr, &size) == ERROR_SUCCESS && type == REG_SZ) {
        std::vector<char> buffer(size + 1, '\0');
        if (RegQueryValueExA(key, "icuDir", nullptr, nullptr, reinterpret_cast<BYTE *>(buffer.data()), &size) ==
            ERROR_SUCCESS)
            dir = buffer.data();
    }
    RegCloseKey(key);
    return dir;
}

// "%s\%s" in a 260-byte buffer; a directory too long for it loads nothing.
std::string InDirectory(const std::string &dir, const char *name)
{
    char path[260];
    int n = snprintf(path, sizeof path, "%s\\%s", dir.c_str(), name);
    return n > 0 && n < static_cast<int>(sizeof path) ? path : "";
}

template <class F> void Fetch(const SharedLibrary &lib, F &slot, const char *name)
{
    slot = reinterpret_cast<F>(reinterpret_cast<void *>(lib.GetSymbol(name)));
}
} // namespace

Icu::Icu(const std::string &directory)
{
    if (!directory.empty()) {
        SharedLibrary data(InDirectory(directory, "icudt24l"));
        if (data.IsLoaded()) {
            SharedLibrary common(InDirectory(directory, "icuuc24"));
            if (common.IsLoaded()) {
                m_data.Swap(data);
                m_common.Swap(common);
            }
        }
    }
    if (!m_common.IsLoaded()) {
        SharedLibrary data("icudt24l");
        SharedLibrary common("icuuc24");
        if (data.IsLoaded() && common.IsLoaded()) {
            m_data.Swap(data);
            m_common.Swap(common);
        }
    }
    if (!m_common.IsLoaded())
        return;
    try {
        Bind();
    } catch (const exception::Exception &) {
        // A common library without every entry point is no ICU 2.4: the
        // binding stays unbound, and conversions raise LibraryNotLoaded.
        Unbind();
    }
}

void Icu::Unbind()
{
    ucnv_open = nullptr;
    ucnv_close = nullptr;
    ucnv_setToUCallBack = nullptr;
    ucnv_cbToUWriteUChars = nullptr;
    ucnv_toUChars = nullptr;
    ucnv_getMinCharSize = nullptr;
    ucnv_cbFromUWriteBytes = nullptr;
    ucnv_setFromUCallBack = nullptr;
    ucnv_fromUChars = nullptr;
    u_strFromWCS = nullptr;
    u_strToWCS = nullptr;
    u_strcasecmp = nullptr;
    SharedLibrary noData, noCommon;
    m_data.Swap(noData);
    m_common.Swap(noCommon);
}

void Icu::Bind()
{
    Fetch(m_common, ucnv_setToUCallBack, "ucnv_setToUCallBack_2_4");
    Fetch(m_common, ucnv_open, "ucnv_open_2_4");
    Fetch(m_common, ucnv_close, "ucnv_close_2_4");
    Fetch(m_common, ucnv_cbToUWriteUChars, "ucnv_cbToUWriteUChars_2_4");
    Fetch(m_common, ucnv_toUChars, "ucnv_toUChars_2_4");
    Fetch(m_common, ucnv_getMinCharSize, "ucnv_getMinCharSize_2_4");
    Fetch(m_common, ucnv_cbFromUWriteBytes, "ucnv_cbFromUWriteBytes_2_4");
    Fetch(m_common, ucnv_setFromUCallBack, "ucnv_setFromUCallBack_2_4");
    Fetch(m_common, ucnv_fromUChars, "ucnv_fromUChars_2_4");
    Fetch(m_common, u_strFromWCS, "u_strFromWCS_2_4");
    Fetch(m_common, u_strToWCS, "u_strToWCS_2_4");
    Fetch(m_common, u_strcasecmp, "u_strcasecmp_2_4");
}

const Icu &Icu::Instance()
{
    // Made once; callers arriving meanwhile yield until it is ready, which it
    // always becomes, bound or not.
    static std::atomic<int> state{0}; // 0 not made, 1 being made, 2 ready
    static Icu *instance = nullptr;
    int expected = 0;
    if (state.compare_exchange_strong(expected, 1)) {
        static Icu made(IcuDirectory());
        instance = &made;
        state = 2;
    }
    while (state.load() != 2)
        Sleep(0);
    if (!instance->IsBound())
        throw exception::LibraryNotLoaded("tw/hmx/osdep/icu", 59);
    return *instance;
}

} // namespace tw::hmx::osdep
