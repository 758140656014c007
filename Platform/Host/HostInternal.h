// Pieces of the hosted environment that call each other. Not for the image.
#pragma once

#include "HostUefi.h"

// The shell (EFI_SHELL_PROTOCOL and its mini shell), installed on a handle of
// its own by HostInitialize and removed by HostShutdown. It uses only the
// public boot-services table.
void HostShellInstall(EFI_SYSTEM_TABLE *SystemTable);
void HostShellUninstall();

// A volume backed by a host directory: EFI_SIMPLE_FILE_SYSTEM_PROTOCOL and a
// vendor device path on a new handle. The shell names it "ramfs:" as well as
// its fsN name.
EFI_HANDLE HostRamfsInstall(const char *Directory);
void HostRamfsUninstall();

// Unicode Collation 2 answering for "eng", on a handle of its own.
void HostCollationInstall();
void HostCollationUninstall();

// Text conversions between the firmware's UCS-2 and the host's UTF-8. UCS-2
// has no surrogate pairs: every 16-bit unit is one character, and code points
// outside the basic plane (or malformed UTF-8) become U+FFFD.
#include <string>
std::string HostUcs2ToUtf8(const CHAR16 *Text, size_t Length);
std::string HostUcs2ToUtf8(const CHAR16 *Text); // up to the terminator; null gives ""
std::u16string HostUtf8ToUcs2(const char *Text);

// The handle HostRamfsInstall put the RAM disk on; null when it is not installed.
EFI_HANDLE HostRamfsHandle();
