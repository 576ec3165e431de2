#pragma once
// "RegServer" and "UnregServer": the server's registry records, its OPC
// component categories and the type-library attempt.
#include <windows.h>

// Returns the result that becomes the process's exit code.
HRESULT RegisterServer();
// Removes the records; reports nothing.
HRESULT UnregisterServer();
