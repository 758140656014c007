// The environment core's own seams: how the pieces of the firmware tables
// (console, boot services, protocol database, runtime services, configuration
// tables) are assembled by HostInitialize and torn down by HostShutdown.
#pragma once

#include "HostInternal.h"

#include <stddef.h>

// ---------------------------------------------------------------------------
// Console (HostConsole.cpp)
// ---------------------------------------------------------------------------
EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *HostConsoleOut();
EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *HostConsoleErr();

// ---------------------------------------------------------------------------
// Pool, events, timers and TPL (HostBootServices.cpp)
// ---------------------------------------------------------------------------
// Fills the memory, event, timer and miscellaneous slots.
void HostBootServicesFillCore(EFI_BOOT_SERVICES *Bs);
// Closes every event and drops pending notifications; TPL back to application.
void HostEventsReset();
// Entry hook of every boot service: delivers due timers and the notifications
// they make pending, above the current TPL.
void HostServicePoll();
// Counted pool allocation without the entry hook, for the environment's own
// results (handle buffers and the like) that the caller frees with FreePool.
void *HostPoolAllocate(size_t Size);
EFI_STATUS EFIAPI HostSignalEvent(EFI_EVENT Event);
EFI_STATUS EFIAPI HostCalculateCrc32(void *Data, UINTN DataSize, UINT32 *Crc32);

// ---------------------------------------------------------------------------
// Handles and protocols (HostProtocolDb.cpp)
// ---------------------------------------------------------------------------
void HostBootServicesFillProtocols(EFI_BOOT_SERVICES *Bs);
// A handle that stays valid while it carries no protocol (the image handle).
EFI_HANDLE HostCreatePermanentHandle();
// Removes every handle and registration.
void HostProtocolDbReset();

// ---------------------------------------------------------------------------
// Runtime services and the variable store (HostRuntime.cpp)
// ---------------------------------------------------------------------------
void HostRuntimeFill(EFI_RUNTIME_SERVICES *Rt);
void HostVariablesOpen(const char *Path);
void HostVariablesClose();

// ---------------------------------------------------------------------------
// Configuration table (HostConfigTables.cpp)
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI HostInstallConfigurationTable(const EFI_GUID *Guid, void *Table);
// Publishes the fake IPMI transport and the SMBIOS tables as configured.
void HostConfigTablesInstall();
// Removes all entries and returns the IPMI and SMBIOS settings to defaults.
void HostConfigTablesUninstall();
// Recomputes the system table's header checksum after a change.
void HostSystemTableChanged();
