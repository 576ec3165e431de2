#pragma once
// The server browser's class, as every OPC installation names it.
#include <windows.h>

constexpr CLSID CLSID_OPCServerList = {0x13486d51, 0x4821, 0x11d2, {0xa4, 0x94, 0x3c, 0xb3, 0x06, 0xc1, 0x00, 0x00}};
