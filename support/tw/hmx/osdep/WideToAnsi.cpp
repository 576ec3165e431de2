#include "WideToAnsi.h"

#include "../exception/Exception.h"
#include "CadroNetwork.h"

#include <cwchar>
#include <new>

namespace tw::hmx::osdep {

namespace {
// Context of one conversion's substitution callback.
struct Substitution {
    const Icu *icu;
    UConverterFromUCallback previous;
    const void *previousContext;
    char byte;
};

void Substitute(const void *context, UConverterFromUnicodeArgs *args, const UChar *, int32_t, int32_t,
                UConverterCallbackReason reason, UErrorCode *err)
{
    auto *s = static_cast<Substitution *>(const_cast<void *>(context));
    if (reason == UCNV_CLOSE) {
        delete s;
        return;
    }
    if (reason <= UCNV_IRREGULAR) {
        *err = 0;
        s->icu->ucnv_cbFromUWriteBytes(args, &s->byte, 1, 0, err);
    }
}

char *Allocate(size_t bytes)
{
    auto *p = static_cast<char *>(tw_hmx_mem_malloc(bytes));
    if (!p)
        throw std::bad_alloc();
    return p;
}
AnsiText EmptyText()
{
    AnsiText empty(Allocate(1));
    empty.get()[0] = '\0';
    return empty;
}
} // namespace

void TwMemFree::operator()(char *p) const
{
    tw_hmx_mem_free(p);
}

AnsiText WideToAnsi(const wchar_t *begin, const wchar_t *end, const char *encoding, const Icu &icu)
{
    if (!encoding)
        throw exception::InvalidLocale("tw/hmx/osdep/WideToAnsi", 103);
    size_t length = begin && end > begin ? static_cast<size_t>(end - begin) : 0;
    if (length == 0)
        return EmptyText(); // ICU is not touched
    UErrorCode err = 0;
    UConverter *converter = icu.ucnv_open(*encoding ? encoding : nullptr, &err);
    if (!converter || U_FAILURE(err))
        throw exception::InvalidLocale("tw/hmx/osdep/WideToAnsi", 127);
    auto *context = new (std::nothrow) Substitution{&icu, nullptr, nullptr, '?'};
    if (!context) {
        icu.ucnv_close(converter);
        throw std::bad_alloc();
    }
    err = 0;
    icu.ucnv_setFromUCallBack(converter, Substitute, context, &context->previous, &context->previousContext, &err);
    if (U_FAILURE(err))
        delete context; // not installed: the converter will not free it
    // Two bytes per character bound the output.
    size_t capacity = 2 * length;
    AnsiText out(Allocate(capacity + 1));
    err = 0;
    int32_t written = icu.ucnv_fromUChars(converter, out.get(), static_cast<int32_t>(capacity), begin,
                                          static_cast<int32_t>(length), &err);
    icu.ucnv_close(converter);
    size_t n = written < 0 ? 0 : static_cast<size_t>(written) > capacity ? capacity : static_cast<size_t>(written);
    out.get()[n] = '\0';
    return out;
}

AnsiText WideToAnsi(const wchar_t *begin, const wchar_t *end, const char *encoding)
{
    if (!encoding)
        throw exception::InvalidLocale("tw/hmx/osdep/WideToAnsi", 103);
    if (!begin || end <= begin)
        return EmptyText();
    return WideToAnsi(begin, end, encoding, Icu::Instance());
}

AnsiText WideToAnsi(const wchar_t *text, const char *encoding)
{
    return WideToAnsi(text, text ? text + wcslen(text) : text, encoding);
}

} // namespace tw::hmx::osdep
