#pragma once
// Judges whether a text is a well-formed Cadro URL without asking the network:
// \\machine\process\object[\object...][.member]. Exact, case-sensitive, no
// state.
#include <windows.h>

// The checker's result codes; 0 is well formed.
enum class ItemIdCode {
    Ok = 0,
    NoObjectPath = 2,
    NothingAfterPrefix = 3,
    NothingAfterMachine = 4,
    ThirdBackslash = 5,
    NoPrefix = 6,
    MachineNotEnded = 7,
    DoubledSeparator = 8,
    BadProcess = 9,
    TrailingCharacters = 11,
    EmptyName = 12,
    BadMachineStart = 13,
    UnclosedQuote = 14,
};

ItemIdCode CheckItemIdentifierCode(const wchar_t *text);
// The HRESULT of the checker (S_OK when well formed).
HRESULT CheckItemIdentifier(const wchar_t *text);
HRESULT ItemIdCodeToHResult(ItemIdCode code);
