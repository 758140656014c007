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
