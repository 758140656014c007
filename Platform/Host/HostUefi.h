// The hosted UEFI environment: firmware tables, boot and runtime services, a
// shell and a RAM-disk volume, all inside one Linux process. The image's code
// runs on top of it unchanged.
//
// This header is the environment's control surface for the host program and
// for tests; the image itself only ever sees the UEFI tables.
#pragma once

#include "Uefi.h"

#include <stdint.h>

struct HostConfig {
  const char *RamfsDir = nullptr; // backs ramfs:; default "./ramfs", created if missing
  const char *VarStore = nullptr; // variable store file; default "./cifsdrv-vars.txt"
};

// Builds the system table and installs the environment's protocols (shell,
// shell parameters come later with HostRunImage, Unicode Collation 2, ramfs:).
// Reads the variable store. Returns the system table.
EFI_SYSTEM_TABLE *HostInitialize(const HostConfig &Config);
// Tears everything down (protocol database, events, volumes). Pool blocks the
// image leaked stay counted.
void HostShutdown();

EFI_HANDLE HostImageHandle();
EFI_SYSTEM_TABLE *HostSystemTable();

// Installs EFI_SHELL_PARAMETERS_PROTOCOL (built from Argv, converted to UCS-2)
// and EFI_LOADED_IMAGE_PROTOCOL on the image handle, calls the image entry
// EfiMain and uninstalls both again. Returns the entry's status.
EFI_STATUS HostRunImage(int Argc, char **Argv);

// Pool accounting: blocks handed out by AllocatePool and not yet freed.
uint64_t HostPoolOutstanding();
uint64_t HostPoolOutstandingBytes();
// The most bytes outstanding at once since the environment was set up, or
// since the last HostPoolResetPeak (which starts it at what is in use now).
uint64_t HostPoolPeakBytes();
void HostPoolResetPeak();

// Delivers due timer notifications (also done inside every boot-services
// call, never from a signal handler).
void HostDispatchTimers();

// Variable store: reload from / flush to the file named in HostConfig. A
// reload drops volatile changes not yet written (which HostShutdown writes).
void HostVariablesReload();
void HostVariablesFlush();

// Fake IPMI transport in the configuration table under
// {4F6B6541-ADD6-4B0F-A503-D78ABDA0851E}. With Enabled false the table entry
// is absent. Response bytes are returned for every request; SendStatus is the
// transport's status for each of the first FailCount attempts, success after.
struct HostIpmiConfig {
  bool Enabled = false;
  uint8_t Response[256] = {};
  uint32_t ResponseLength = 0;
  EFI_STATUS SendStatus = EFI_SUCCESS;
  uint32_t FailCount = 0;
};
void HostSetIpmi(const HostIpmiConfig &Config);
// Requests seen by the fake transport: NetFn, command and the data bytes.
struct HostIpmiRequest {
  uint8_t NetFn;
  uint8_t Command;
  uint8_t Data[32];
  uint32_t DataLength;
};
uint32_t HostIpmiRequestCount();
HostIpmiRequest HostIpmiLastRequest();

// SMBIOS table served through the configuration table: a type-3 (chassis)
// record carrying the asset tag, and a type-1 record with the serial number.
// Null asset tag removes the table.
void HostSetSmbiosAssetTag(const char *AssetTag);

// The console: everything written to ConOut also goes to stdout unless muted.
// Tests can capture it.
void HostConsoleCaptureBegin();
// Returns the text written since HostConsoleCaptureBegin, as UTF-8, and ends
// the capture. The returned pointer stays valid until the next capture.
const char *HostConsoleCaptureEnd();

// Allocation-failure injection for tests: the next Allocations pool
// allocations succeed and the one after them fails (once). UINT64_MAX turns
// the injection off; HostShutdown does as well.
void HostPoolFailAfter(uint64_t Allocations);
