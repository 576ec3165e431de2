#include "ItemIdChecker.h"

#include <cwchar>

namespace {
bool IsNameStop(wchar_t c)
{
    return c == L'\\' || c == L'.' || c == L'\'' || c == L'\r' || c == L'\n';
}

bool IsMachineStop(wchar_t c)
{
    return IsNameStop(c) || c == L'/' || c == L' ' || c == L'\t';
}

bool IsLetter(wchar_t c)
{
    return (c >= L'a' && c <= L'z') || (c >= L'A' && c <= L'Z');
}

bool IsDigit(wchar_t c)
{
    return c >= L'0' && c <= L'9';
}

bool IsSeparator(wchar_t c)
{
    return c == L'\\' || c == L'.';
}

// Reads one name at p (quoted or plain); returns Ok or the failure.
ItemIdCode ReadName(const wchar_t *&p)
{
    if (*p == L'\'') {
        for (++p;; ++p) {
            if (*p == L'\0')
                return ItemIdCode::UnclosedQuote;
            if (*p == L'\'') {
                if (p[1] == L'\'') {
                    ++p; // a doubled quote stands for one apostrophe
                    continue;
                }
                ++p;
                return ItemIdCode::Ok;
            }
        }
    }
    const wchar_t *start = p;
    while (*p && !IsNameStop(*p))
        ++p;
    return p == start ? ItemIdCode::EmptyName : ItemIdCode::Ok;
}
} // namespace

ItemIdCode CheckItemIdentifierCode(const wchar_t *text)
{
    const wchar_t *p = text;
    if (!p || p[0] != L'\\' || p[1] != L'\\')
        return ItemIdCode::NoPrefix;
    p += 2;
    if (*p == L'\\')
        return ItemIdCode::ThirdBackslash;
    if (*p == L'\0')
        return ItemIdCode::NothingAfterPrefix;

    // Machine: "." for this machine, else a name in which dots may occur.
    if (*p == L'.') {
        ++p;
    } else {
        if (IsMachineStop(*p))
            return ItemIdCode::BadMachineStart;
        while (*p && (!IsMachineStop(*p) || *p == L'.'))
            ++p;
    }
    if (*p == L'\0')
        return ItemIdCode::NothingAfterMachine;
    if (*p != L'\\')
        return ItemIdCode::MachineNotEnded;
    ++p;
    if (IsSeparator(*p))
        return ItemIdCode::DoubledSeparator;

    // Process: a letter, then letters, digits and "_".
    if (*p == L'\0')
        return ItemIdCode::NothingAfterMachine;
    if (!IsLetter(*p))
        return ItemIdCode::BadProcess;
    while (IsLetter(*p) || IsDigit(*p) || *p == L'_')
        ++p;
    if (*p == L'\0')
        return ItemIdCode::NoObjectPath;
    if (*p != L'\\')
        return ItemIdCode::BadProcess;
    ++p;
    if (IsSeparator(*p))
        return ItemIdCode::DoubledSeparator;

    // Object path: names separated by "\" or ".".
    if (*p == L'\0')
        return ItemIdCode::NoObjectPath;
    ItemIdCode code = ReadName(p);
    if (code != ItemIdCode::Ok)
        return code;
    while (IsSeparator(*p)) {
        if (*p == L'.' && p[1] == L'\0')
            return ItemIdCode::Ok; // a final "." is allowed
        ++p;
        if (IsSeparator(*p))
            return ItemIdCode::DoubledSeparator;
        if (*p == L'\0')
            return ItemIdCode::EmptyName;
        code = ReadName(p);
        if (code != ItemIdCode::Ok)
            return code;
    }
    return *p ? ItemIdCode::TrailingCharacters : ItemIdCode::Ok;
}

HRESULT ItemIdCodeToHResult(ItemIdCode code)
{
    switch (code) {
    case ItemIdCode::Ok:
        return S_OK;
    case ItemIdCode::NoObjectPath:
        return static_cast<HRESULT>(0x8ABC0027);
    case ItemIdCode::NothingAfterPrefix:
        return static_cast<HRESULT>(0x8ABC0022);
    case ItemIdCode::NothingAfterMachine:
        return static_cast<HRESULT>(0x8ABC0025);
    case ItemIdCode::ThirdBackslash:
        return static_cast<HRESULT>(0x8ABC0101);
    case ItemIdCode::NoPrefix:
        return static_cast<HRESULT>(0x8ABC0100);
    case ItemIdCode::MachineNotEnded:
        return static_cast<HRESULT>(0x8ABC0024);
    case ItemIdCode::DoubledSeparator:
        return static_cast<HRESULT>(0x8ABC0102);
    case ItemIdCode::BadProcess:
        return static_cast<HRESULT>(0x8ABC0026);
    case ItemIdCode::TrailingCharacters:
        return static_cast<HRESULT>(0x8ABC0028);
    case ItemIdCode::EmptyName:
        return static_cast<HRESULT>(0x8ABC0030);
    case ItemIdCode::BadMachineStart:
        return static_cast<HRESULT>(0x8ABC0023);
    case ItemIdCode::UnclosedQuote:
        return static_cast<HRESULT>(0x8ABC0104);
    }
    return E_FAIL;
}

HRESULT CheckItemIdentifier(const wchar_t *text)
{
    return ItemIdCodeToHResult(CheckItemIdentifierCode(text));
}
