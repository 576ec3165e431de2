// A stand-in for ICU 2.4's common library, for tests of the binding: the
// twelve version-suffixed entry points with just enough behaviour to convert
// UTF-16 to Latin-1 ("" or "ISO-8859-1") or ASCII ("US-ASCII"), calling the
// from-Unicode callback for characters outside the target. Built with
// FAKEICU_PARTIAL it lacks u_strcasecmp_2_4.
#include <cstdint>
#include <cstring>
#include <cwchar>
#include <cwctype>

using UChar = wchar_t;
using UErrorCode = int32_t;
struct UConverterFromUnicodeArgs {
    char *target;
    char *limit;
};
using FromCallback = void (*)(const void *, UConverterFromUnicodeArgs *, const UChar *, int32_t, int32_t, int32_t,
                              UErrorCode *);
struct UConverter {
    unsigned highest;
    FromCallback callback;
    const void *context;
};

#define EXPORT extern "C" __declspec(dllexport)
enum { kUnassigned = 0, kClose = 4, kFileAccessError = 4, kBufferOverflow = 15 };

EXPORT UConverter *ucnv_open_2_4(const char *name, UErrorCode *err)
{
    unsigned highest = 0;
    if (!name || !*name || strcmp(name, "ISO-8859-1") == 0)
        highest = 0xFF;
    else if (strcmp(name, "US-ASCII") == 0)
        highest = 0x7F;
    else {
        *err = kFileAccessError;
        return nullptr;
    }
    return new UConverter{highest, nullptr, nullptr};
}

EXPORT void ucnv_close_2_4(UConverter *c)
{
    if (!c)
        return;
    UErrorCode err = 0;
    if (c->callback)
        c->callback(c->context, nullptr, nullptr, 0, 0, kClose, &err);
    delete c;
}

EXPORT void ucnv_setFromUCallBack_2_4(UConverter *c, FromCallback f, const void *context, FromCallback *old,
                                      const void **oldContext, UErrorCode *)
{
    if (old)
        *old = c->callback;
    if (oldContext)
        *oldContext = c->context;
    c->callback = f;
    c->context = context;
}

EXPORT void ucnv_cbFromUWriteBytes_2_4(UConverterFromUnicodeArgs *args, const char *bytes, int32_t length, int32_t,
                                       UErrorCode *err)
{
    for (int32_t i = 0; i < length; ++i) {
        if (args->target >= args->limit) {
            *err = kBufferOverflow;
            return;
        }
        *args->target++ = bytes[i];
    }
}

EXPORT int32_t ucnv_fromUChars_2_4(UConverter *c, char *dest, int32_t capacity, const UChar *src, int32_t length,
                                   UErrorCode *err)
{
    UConverterFromUnicodeArgs args{dest, dest + capacity};
    for (int32_t i = 0; i < length && *err <= 0; ++i) {
        if (static_cast<unsigned>(src[i]) <= c->highest) {
            if (args.target >= args.limit) {
                *err = kBufferOverflow;
                break;
            }
            *args.target++ = static_cast<char>(src[i]);
        } else if (c->callback) {
            c->callback(c->context, &args, &src[i], 1, src[i], kUnassigned, err);
        }
    }
    int32_t written = static_cast<int32_t>(args.target - dest);
    if (written < capacity)
        dest[written] = '\0';
    return written;
}

EXPORT void ucnv_setToUCallBack_2_4(UConverter *, void *, const void *, void **, const void **, UErrorCode *) {}
EXPORT void ucnv_cbToUWriteUChars_2_4(void *, const UChar *, int32_t, int32_t, UErrorCode *) {}
EXPORT int32_t ucnv_toUChars_2_4(UConverter *, UChar *, int32_t, const char *, int32_t, UErrorCode *)
{
    return 0;
}
EXPORT int8_t ucnv_getMinCharSize_2_4(const UConverter *)
{
    return 1;
}
EXPORT UChar *u_strFromWCS_2_4(UChar *dest, int32_t, int32_t *, const wchar_t *, int32_t, UErrorCode *)
{
    return dest;
}
EXPORT wchar_t *u_strToWCS_2_4(wchar_t *dest, int32_t, int32_t *, const UChar *, int32_t, UErrorCode *)
{
    return dest;
}
#ifndef FAKEICU_PARTIAL
EXPORT int32_t u_strcasecmp_2_4(const UChar *a, const UChar *b, uint32_t)
{
    return _wcsicmp(a, b);
}
#endif
