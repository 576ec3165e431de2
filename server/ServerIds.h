#pragma once
// Identifiers of the server class and its registration.
#include <guiddef.h>

// {5B1E7A20-4C3D-11d3-9A44-00A0C9E2B7F1}
constexpr CLSID CLSID_SkylarcOPCServer = {0x5b1e7a20, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
// {5B1E7A21-4C3D-11d3-9A44-00A0C9E2B7F1}
constexpr GUID APPID_SkylarcOPCServer = {0x5b1e7a21, 0x4c3d, 0x11d3, {0x9a, 0x44, 0x00, 0xa0, 0xc9, 0xe2, 0xb7, 0xf1}};
// {63D5F430-CFE4-11d1-B2C8-0060083BA1FB}
constexpr GUID CATID_OPCDAServer10 = {0x63d5f430, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};
// {63D5F432-CFE4-11d1-B2C8-0060083BA1FB}
constexpr GUID CATID_OPCDAServer20 = {0x63d5f432, 0xcfe4, 0x11d1, {0xb2, 0xc8, 0x00, 0x60, 0x08, 0x3b, 0xa1, 0xfb}};

// Resource identifiers of the two registration scripts (type "REGISTRY").
constexpr int IDR_APPID_SCRIPT = 100;
constexpr int IDR_CLASS_SCRIPT = 101;
