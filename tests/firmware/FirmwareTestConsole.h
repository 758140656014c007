// Console and bookkeeping for the small firmware test images (CryptoCheck,
// NetCheck): each check prints one line that the QEMU scripts read,
//   "@@CHECK ok <what>"  or  "@@CHECK FAIL <what>"
// and the image ends with "@@RESULT <n> passed, <m> failed".
#pragma once

#include "NwBaseLib.h"

// Keeps the firmware tables for the platform code; call first.
void FwTestStart(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);

// printf-style line on the console (the image's formatter; "\n" ends lines).
void FwTestPrint(const char *Format, ...);

// Records and prints one check.
bool FwTestCheck(bool Passed, const char *Format, ...);

// Prints the result line; EFI_SUCCESS when every check passed.
EFI_STATUS FwTestFinish();

// The image's command-line arguments after its name, as 8-bit text in a
// static buffer (Latin-1; enough for addresses and numbers). Null when
// there is no such argument.
const char *FwTestArgument(UINTN Index);

// Milliseconds of the firmware's real-time clock since the image started.
// The clock may only count whole seconds, so differences are accurate to
// about one second.
UINT64 FwTestElapsedMs();

// Hex text of Length bytes (at most 64) in a static buffer.
const char *FwTestHex(const UINT8 *Bytes, UINTN Length);
