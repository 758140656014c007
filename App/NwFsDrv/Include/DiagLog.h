// Console diagnostics: the debug levels and the standard line formats that
// every module prints.
//
// Three independent levels gate the output: the driver level (everything
// outside the SMB2 client), the SMB2 client level and the TCP transport level.
// A line with threshold T is printed when the channel's level is at least T;
// threshold 0 is therefore always printed.
#pragma once

#include "Uefi.h"

extern UINT8 gDriverDebugLevel; // initial 5 until read from "QVUIkestDebugLevel"
extern UINT8 gSMB2DebugLevel;   // initial 0, read from "SMB2DebugLevel"
extern UINT8 gTcpDebugLevel;    // fixed 0: transport trace is compiled in, never printed

enum class DiagChannel : UINT8 { Driver, Smb2, Tcp };

constexpr UINT8 DIAG_ALWAYS = 0;
constexpr UINT8 DIAG_MISMATCH = 1;
constexpr UINT8 DIAG_TRACE = 2;
constexpr UINT8 DIAG_VERBOSE = 5;
constexpr UINT8 DIAG_DUMP = 6;

bool DiagEnabled(DiagChannel Channel, UINT8 Threshold);

// Console prints gated by the driver level; 8-bit and UCS-2 format strings.
void DiagLog(UINT8 Threshold, const CHAR8 *Format, ...);
void DiagLogW(UINT8 Threshold, const CHAR16 *Format, ...);
// The same gated by the SMB2 and the transport levels.
void Smb2Log(UINT8 Threshold, const CHAR8 *Format, ...);
void TcpLog(UINT8 Threshold, const CHAR8 *Format, ...);
// Any channel, with a va_list.
void DiagLogV(DiagChannel Channel, UINT8 Threshold, const CHAR8 *Format, va_list Args);

// Status as printed by the standard lines: the error's number (status AND
// 0xFF) and the status with its top bit cleared; both 0 for success (14 and
// 0xe for EFI_NOT_FOUND). Clearing rather than flipping the bit keeps a
// success status at 0.
constexpr UINT64 DiagStatusNumber(EFI_STATUS Status) {
  return Status & 0xFF;
}
constexpr UINT64 DiagStatusValue(EFI_STATUS Status) {
  return Status & ~EFI_ERROR_BIT;
}

// "Function: %s, Line no.: = %d - %s, Status = %lld (0x%llx)\n", printed
// whatever the level. Function and line default to the call site.
void DiagError(const CHAR8 *Message, EFI_STATUS Status,
               const CHAR8 *Function = __builtin_FUNCTION(), UINT32 Line = __builtin_LINE());
// The same line on a given channel at a given threshold.
void DiagErrorAt(DiagChannel Channel, UINT8 Threshold, const CHAR8 *Message, EFI_STATUS Status,
                 const CHAR8 *Function = __builtin_FUNCTION(), UINT32 Line = __builtin_LINE());
// "\nFunction: %s, Line no.: = %d. Entered\n" at trace level.
void DiagEntry(DiagChannel Channel = DiagChannel::Driver,
               const CHAR8 *Function = __builtin_FUNCTION(), UINT32 Line = __builtin_LINE());
// "Function: %s, Line no.: = %d. Exiting! Status = %lld (0x%llx)\n" at trace level.
void DiagExit(EFI_STATUS Status, DiagChannel Channel = DiagChannel::Driver,
              const CHAR8 *Function = __builtin_FUNCTION(), UINT32 Line = __builtin_LINE());
// "Function: %s, Line no.: = %d, Input parameter is NULL!\n" (SMB2 client).
void DiagNullInput(DiagChannel Channel = DiagChannel::Smb2,
                   const CHAR8 *Function = __builtin_FUNCTION(), UINT32 Line = __builtin_LINE());

// "Entering %s\n" at trace level.
void DiagShortEntry(DiagChannel Channel = DiagChannel::Driver,
                    const CHAR8 *Function = __builtin_FUNCTION());
// "Exiting %s, Status = 0x%x\n" (Separator ',') or "Exiting %s. Status = 0x%x\n"
// (Separator '.') at trace level; the status is printed truncated to 32 bits.
void DiagShortExit(EFI_STATUS Status, CHAR8 Separator = ',',
                   DiagChannel Channel = DiagChannel::Driver,
                   const CHAR8 *Function = __builtin_FUNCTION());

// The GUID line "Guid = {%08lX-%04hX-%04hX-%02hhX%02hhX-%02hhX...}\n" on the
// driver channel. Prefix (may be null) is printed verbatim in front of it, e.g.
// a "main (221): " built by the caller.
void DiagGuid(UINT8 Threshold, const CHAR8 *Prefix, const EFI_GUID &Guid);

// The vendor GUID of the debug-level variables (and of the client's other
// settings, such as "SMB2Signing").
extern const EFI_GUID gDebugLevelVariableGuid;

// The two level initialisers, reading their UEFI variables.
EFI_STATUS QVUIkestDebugLevelInitialize(UINT8 *DebugLevel);
EFI_STATUS SMB2DebugLevelInitialize(UINT8 *DebugLevel);
