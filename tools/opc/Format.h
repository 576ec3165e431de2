#pragma once
// How opc shows OPC data: value types, qualities, time stamps and values, as
// text for people and as JSON for scripts.
#include <windows.h>

#include <oleauto.h>

#include <string>

// Readable name of a VARTYPE ("double", "string", "int32[]", ...).
std::wstring TypeName(VARTYPE type);
// VARTYPE named by text ("double", "r8", "VT_R8", "string[]", ...); false
// when the name is unknown.
bool ParseTypeName(const std::wstring &name, VARTYPE &type);

// "good", "bad (not connected)", "uncertain (last usable value), low limited".
std::wstring QualityText(WORD quality);

// ISO 8601 in local time with the offset from UTC, to the millisecond
// ("2026-11-23T14:05:09.120+01:00"); empty for a zero time.
std::wstring LocalTimeText(const FILETIME &utc);

// The value as people read it: numbers in the invariant format, true and
// false, strings as they are, arrays in brackets.
std::wstring ValueText(const VARIANT &value);
// The value as a JSON value: numbers, true/false, null when empty, strings
// quoted, arrays as arrays.
std::wstring ValueJson(const VARIANT &value);

// A JSON string literal, quotes included.
std::wstring JsonString(const std::wstring &text);

// "0xC0040007".
std::wstring HexCode(HRESULT code);
