#pragma once
// The three OPC DA 1.0 stream formats, built in HGLOBALs: data with time
// stamps, data, and write completion. Byte layouts are fixed by the standard
// (little-endian, no padding; values as 16-byte VARIANTs, BSTRs followed by
// their byte length and characters with the terminator).
#include "opcda.h"

namespace OpcStreams {
// Clipboard format numbers of "OPCSTMFORMATDATA", "OPCSTMFORMATDATATIME" and
// "OPCSTMFORMATWRITECOMPLETE", registered once for the process.
CLIPFORMAT Data();
CLIPFORMAT DataTime();
CLIPFORMAT WriteComplete();

HRESULT BuildData(bool withTime, OPCHANDLE hGroup, DWORD transactionId, DWORD count, const OPCHANDLE *clients,
                  const VARIANT *values, const WORD *qualities, const FILETIME *times, HGLOBAL *out);
HRESULT BuildWriteComplete(OPCHANDLE hGroup, DWORD transactionId, DWORD count, const OPCHANDLE *clients,
                           const HRESULT *errors, HGLOBAL *out);
} // namespace OpcStreams
