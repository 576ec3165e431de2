#pragma once
// One line per item for read and subscribe: value, type, quality and time
// stamp, or the item's error.
#include "Connection.h"
#include "Output.h"

#include <string>

std::wstring ItemValueLine(bool json, const std::wstring &id, const VARIANT &value, WORD quality, const FILETIME &time);

// "opc: <verb> <id>: <server's text> (0x...)" on standard error, or a JSON
// line {"item":..,"error":..,"message":..} on standard output.
void ReportItemError(Output &out, const Connection &server, const wchar_t *verb, const std::wstring &id, HRESULT error);
