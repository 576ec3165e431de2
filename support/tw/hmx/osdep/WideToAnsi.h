#pragma once
// Wide text to 8-bit text through an ICU converter; characters the encoding
// cannot represent become "?".
#include "icu.h"

#include <memory>

namespace tw::hmx::osdep {

struct TwMemFree {
    void operator()(char *p) const;
};
// A zero-terminated 8-bit string from the twhmxmem allocator.
using AnsiText = std::unique_ptr<char, TwMemFree>;

// encoding is an ICU converter name ("" for ICU's default). Raises
// InvalidLocale for a null or unknown encoding and LibraryNotLoaded when
// ICU is needed but absent.
AnsiText WideToAnsi(const wchar_t *begin, const wchar_t *end, const char *encoding);
AnsiText WideToAnsi(const wchar_t *text, const char *encoding);
// The same with a given binding (tests bind their own libraries).
AnsiText WideToAnsi(const wchar_t *begin, const wchar_t *end, const char *encoding, const Icu &icu);

} // namespace tw::hmx::osdep
