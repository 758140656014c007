// Pieces shared by the hosted shell (HostShell.cpp, HostShellCommands.cpp)
// and the ramfs: volume (HostRamfs.cpp). Not for the image.
#pragma once

#include "HostInternal.h"

#include <functional>
#include <string>
#include <vector>

// ---------------------------------------------------------------------------
// Text
// ---------------------------------------------------------------------------
// (UCS-2 <-> UTF-8 conversions are HostInternal.h's.)
// Names compare with ASCII letters folded, as firmware file systems do.
bool HostNameEqual(const std::u16string &A, const std::u16string &B);
bool HostNameEqual(const std::string &A, const std::string &B);
// The components of a '\' separated path; empty components are dropped.
std::vector<std::u16string> HostSplitPath(const std::u16string &Path);
std::u16string HostDecimal(UINT64 Value);
std::u16string HostHex(UINT64 Value);

// ---------------------------------------------------------------------------
// Device paths
// ---------------------------------------------------------------------------
// Size in bytes including the end node; 0 when the path is malformed (a node
// shorter than its header or a path longer than a sane maximum).
UINTN HostDevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *Path);
std::u16string HostDevicePathText(const EFI_DEVICE_PATH_PROTOCOL *Path);

// ---------------------------------------------------------------------------
// The shell's state as seen by its commands
// ---------------------------------------------------------------------------
struct ShellMapping {
  std::u16string Name;           // without the trailing ':'
  std::vector<UINT8> DevicePath; // a copy, end node included
};

// Console output of a command: goes to whatever ConOut the system table holds
// at the time, so that redirection and the caller's own capture both see it.
void ShellOut(const std::u16string &Text);

// Handles with a file system and a device path, in the database's order.
struct ShellVolume {
  EFI_HANDLE Handle;
  std::vector<UINT8> DevicePath;
};
std::vector<ShellVolume> ShellPresentVolumes();
// A copy of a device path; empty when it is malformed.
std::vector<UINT8> ShellDevicePathBytes(const EFI_DEVICE_PATH_PROTOCOL *Path);
EFI_STATUS ShellOpenVolume(EFI_HANDLE Handle, EFI_FILE_PROTOCOL **Root);

// The mapping table and current directories live from ShellPathsStart (which
// maps every volume present) to ShellPathsStop.
void ShellPathsStart(EFI_BOOT_SERVICES *BootServices);
void ShellPathsStop();
// Rebuilds (Reset) or updates the mapping table from the volumes present.
void ShellMapRefresh(bool Reset);
const std::vector<ShellMapping> &ShellMappings();
// Accepts the name with or without its ':'; case-insensitive. Null if absent.
const ShellMapping *ShellMapFind(const std::u16string &Name);
// Adds Name (no ':') for a device path, replacing an older use of the name.
EFI_STATUS ShellMapAdd(const std::u16string &Name, const std::vector<UINT8> &DevicePath);
EFI_STATUS ShellMapDelete(const std::u16string &Name);
// Opens the root directory of the volume a mapping refers to.
EFI_STATUS ShellOpenMappingRoot(const ShellMapping &Mapping, EFI_FILE_PROTOCOL **Root);

// Splits a shell path ("fs0:\a\b", "\a", "a\..\b", "fs0:") into its mapping
// name and the absolute, cleaned path on that volume ("\a\b", "\").
EFI_STATUS ShellQualify(const std::u16string &Path, std::u16string *Mapping,
                        std::u16string *VolumePath);
// Opens a shell path through the volume's EFI_FILE_PROTOCOL.
EFI_STATUS ShellOpen(const std::u16string &Path, UINT64 OpenMode, UINT64 Attributes,
                     EFI_FILE_PROTOCOL **File);
// Calls a function that fills a caller's buffer and answers
// EFI_BUFFER_TOO_SMALL with the size it needs, growing the buffer until the
// answer fits. On success *Size is the size returned; two zero bytes beyond the
// buffer's capacity keep every name in it terminated.
EFI_STATUS ShellSizedCall(const std::function<EFI_STATUS(UINTN *Size, void *Buffer)> &Call,
                          std::vector<UINT8> *Buffer, UINTN *Size);
// An EFI_FILE_INFO of Size bytes whose own Size field stays within them.
bool ShellValidFileInfo(const std::vector<UINT8> &Info, UINTN Size);
// GetInfo through ShellSizedCall; EFI_FILE_INFO results are validated.
EFI_STATUS ShellGetInfo(EFI_FILE_PROTOCOL *File, const EFI_GUID &Type, std::vector<UINT8> *Info);
inline const EFI_FILE_INFO *ShellFileInfo(const std::vector<UINT8> &Info) {
  return reinterpret_cast<const EFI_FILE_INFO *>(Info.data());
}

// "\a\.\b\..\c" -> "\a\c"; ".." above the root stays at the root.
std::u16string ShellCleanPath(const std::u16string &Path);

// Current directory: mapping name and the path on it.
const std::u16string &ShellCurrentMapping();
std::u16string ShellCurrentDirOf(const std::u16string &Mapping);
EFI_STATUS ShellSetCurrent(const std::u16string &Mapping, const std::u16string *VolumePath);
// Sets the directory of a mapping without making it the current one.
void ShellSetDirectoryOf(const std::u16string &Mapping, const std::u16string &Path);

// The built-in commands. The dispatcher splits the flags off (any of the
// command's Flags letters after a '-', anywhere on the line; Flags null means
// the command takes none) and checks the count of the remaining operands.
struct ShellArgs {
  std::u16string Name;  // as typed
  std::u16string Flags; // the flag letters given, lower case
  std::vector<std::u16string> Operands;
  bool Has(char16_t Flag) const { return Flags.find(Flag) != std::u16string::npos; }
};
struct ShellCommand {
  const char16_t *Name;
  const char16_t *Flags;
  UINTN MinOperands;
  UINTN MaxOperands;
  EFI_STATUS (*Run)(const ShellArgs &Args);
};
const ShellCommand *ShellFindCommand(const std::u16string &Name);
// Args[0] is the command name as typed.
EFI_STATUS ShellRunCommand(const ShellCommand &Command, const std::vector<std::u16string> &Args);

// The RAM disk tells the shell when it appears, so that "ramfs:" is mapped
// whatever the order of installation.
void HostShellVolumeArrived();
