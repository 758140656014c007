// Pieces every provisioning task shares: text joining into pool strings, the
// shell "system" call, and the existence check of a file through the shell.
#pragma once

#include "Uefi.h"

// Joins the parts (null parts count as empty) into one pool string. Null when
// the pool is exhausted; the caller frees the result.
CHAR16 *JoinText(const CHAR16 *const *Parts, UINTN Count);
CHAR8 *JoinAscii(const CHAR8 *const *Parts, UINTN Count);

template <UINTN N>
CHAR16 *JoinText(const CHAR16 *const (&Parts)[N]) {
  return JoinText(Parts, N);
}
template <UINTN N>
CHAR8 *JoinAscii(const CHAR8 *const (&Parts)[N]) {
  return JoinAscii(Parts, N);
}

// Runs a command line through the shell and returns the command's own status
// (or the reason it could not be launched), as a C library's system() does.
EFI_STATUS RunSystemCommand(const CHAR8 *CommandLine);
EFI_STATUS RunSystemCommandW(const CHAR16 *CommandLine);

// Prints the status line "\n (<line>)Status = [<status>]\n" with the caller's
// source line.
void PrintCommandStatus(EFI_STATUS Status, UINT32 Line = __builtin_LINE());

// True when Path opens for reading through the shell; the file is closed
// again at once.
bool ShellFileOpens(const CHAR16 *Path);
bool ShellFileOpensAscii(const CHAR8 *Path);

// The size of the file at Path, from its EFI_FILE_INFO through the shell.
// False when it does not open.
bool ShellFileSize(const CHAR16 *Path, UINT64 *Size);

// A copy from the share counts only when it arrived whole. SourceFound and
// SourceSize are the source as measured before the copy ran. The verdict:
// Success when the source was found, the copy command succeeded and
// Destination holds exactly SourceSize bytes; otherwise EFI_NOT_FOUND when
// there was no source and EFI_DEVICE_ERROR when there was, and whatever the
// copy left at Destination is deleted through the shell.
EFI_STATUS ConfirmCopy(bool SourceFound, UINT64 SourceSize, EFI_STATUS CommandStatus,
                       const CHAR16 *Destination);
// Measures Source, runs the 8-bit copy command line through the shell and
// confirms the copy into Destination as above.
EFI_STATUS RunConfirmedCopy(const CHAR8 *CommandLine, const CHAR8 *Source,
                            const CHAR8 *Destination);
