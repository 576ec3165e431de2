#pragma once
// The binding to ICU 2.4's converters, loaded at run time from its data
// library (icudt24l) and common library (icuuc24) with version-suffixed
// entry points. Only the C ABI of those functions is declared here.
#include "SharedLibrary.h"

#include <cstdint>
#include <string>

namespace tw::hmx::osdep {

using UChar = wchar_t; // UTF-16 code unit on Windows
using UErrorCode = int32_t;
struct UConverter;
struct UConverterFromUnicodeArgs;
struct UConverterToUnicodeArgs;
enum UConverterCallbackReason : int32_t { UCNV_UNASSIGNED, UCNV_ILLEGAL, UCNV_IRREGULAR, UCNV_RESET, UCNV_CLOSE };
using UConverterFromUCallback = void (*)(const void *context, UConverterFromUnicodeArgs *args, const UChar *codeUnits,
                                         int32_t length, int32_t codePoint, UConverterCallbackReason reason,
                                         UErrorCode *err);
using UConverterToUCallback = void (*)(const void *context, UConverterToUnicodeArgs *args, const char *codeUnits,
                                       int32_t length, UConverterCallbackReason reason, UErrorCode *err);
inline bool U_FAILURE(UErrorCode code)
{
    return code > 0;
}

class Icu {
public:
    // The process-wide binding, made on first use from the directory in the
    // registry value "icuDir", else by bare library names. Raises
    // LibraryNotLoaded when ICU could not be bound.
    static const Icu &Instance();

    // A binding of the libraries in directory (empty: by bare names).
    // Without both libraries, or when an entry point is missing, the entry
    // points stay null.
    explicit Icu(const std::string &directory);
    bool IsBound() const { return ucnv_open != nullptr; }

    UConverter *(*ucnv_open)(const char *name, UErrorCode *err) = nullptr;
    void (*ucnv_close)(UConverter *converter) = nullptr;
    void (*ucnv_setToUCallBack)(UConverter *, UConverterToUCallback, const void *, UConverterToUCallback *,
                                const void **, UErrorCode *) = nullptr;
    void (*ucnv_cbToUWriteUChars)(UConverterToUnicodeArgs *, const UChar *, int32_t, int32_t, UErrorCode *) = nullptr;
    int32_t (*ucnv_toUChars)(UConverter *, UChar *, int32_t, const char *, int32_t, UErrorCode *) = nullptr;
    int8_t (*ucnv_getMinCharSize)(const UConverter *) = nullptr;
    void (*ucnv_cbFromUWriteBytes)(UConverterFromUnicodeArgs *, const char *, int32_t, int32_t, UErrorCode *) = nullptr;
    void (*ucnv_setFromUCallBack)(UConverter *, UConverterFromUCallback, const void *, UConverterFromUCallback *,
                                  const void **, UErrorCode *) = nullptr;
    int32_t (*ucnv_fromUChars)(UConverter *, char *, int32_t, const UChar *, int32_t, UErrorCode *) = nullptr;
    UChar *(*u_strFromWCS)(UChar *, int32_t, int32_t *, const wchar_t *, int32_t, UErrorCode *) = nullptr;
    wchar_t *(*u_strToWCS)(wchar_t *, int32_t, int32_t *, const UChar *, int32_t, UErrorCode *) = nullptr;
    int32_t (*u_strcasecmp)(const UChar *, const UChar *, uint32_t) = nullptr;

private:
    void Bind();
    void Unbind();

    SharedLibrary m_data;
    SharedLibrary m_common;
};

} // namespace tw::hmx::osdep
