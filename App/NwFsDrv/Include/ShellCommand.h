// Shell command execution and volume mapping: how the image runs UEFI Shell
// commands ("map", "vol", "cd", "cp", ...) and finds the shell name of a
// volume by its label.
//
// Commands go through EFI_SHELL_PROTOCOL.Execute. The older shell environment
// protocols are still located (and reported missing) where the image always
// looked for them, but current firmware does not carry them; the shell
// protocol binding found by InitializeSystemEnv takes their place.
#pragma once

#include "Uefi.h"

// {47C7B221-C42A-11D2-8E57-00A0C969723B}: the older shell environment.
extern const EFI_GUID gNwShellEnvProtocolGuid;
// {47C7B223-C42A-11D2-8E57-00A0C969723B}: the older shell interface.
extern const EFI_GUID gNwShellInterfaceGuid;
// {47C7B225-C42A-11D2-8E57-00A0C969723B}: the shell's mapping variables.
extern const EFI_GUID gNwShellMapGuid;

// Capacity, in characters, of every drive name and volume label buffer.
constexpr UINTN NWFS_DRIVE_NAME_CHARS = 20;
// Command lines for "map"/"vol" are formatted into 60 bytes.
constexpr UINTN NWFS_COMMAND_BYTES = 60;
// Labels and table rows are compared on this many characters.
constexpr UINTN NWFS_LABEL_COMPARE_CHARS = 6;

// The shell binding found at start-up (EFI_SHELL_PROTOCOL) and whether it was
// found.
extern EFI_HANDLE gShellEnv2Handle;
extern EFI_SHELL_PROTOCOL *gShellEnv2;
extern BOOLEAN gShellEnv2Found;
// Asks ExecuteShellCommand to check the tools volume first. Never set: the
// check is kept compiled in but inactive.
extern BOOLEAN gCheckToolsVolume;
// Status of the last command the command runner launched (the launch status
// when it could not be launched).
extern EFI_STATUS gLastCommandStatus;

// Locates the older shell environment protocol into gShellEnvProtocol,
// printing "\nlocate protocol failed!" (absent) or "\nLocate Protocol
// Failed!" (other failure) under the given function name. Never fatal.
extern void *gShellEnvProtocol;
EFI_STATUS LocateShellEnvironment(const CHAR8 *Function, UINT32 Line = __builtin_LINE());

// Finds the shell binding: the first EFI_SHELL_PROTOCOL handle with a major
// version of 1 or more.
EFI_STATUS InitializeSystemEnv(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);

// The shell protocol: the start-up binding, else whatever is installed now;
// null without one.
EFI_SHELL_PROTOCOL *CurrentShell();

// Runs one command line through the shell binding. EFI_INVALID_PARAMETER for
// a null command or without the binding; otherwise the command's status (or
// the launch failure).
EFI_STATUS ExecuteShellCommand(const CHAR16 *CommandLine);

// The short command runner: 0 when the shell launched the command, -1 when it
// could not, 1 for a null command. The command's own status lands in
// gLastCommandStatus.
INTN RunShellCommand(const CHAR16 *CommandLine);
// The same from an 8-bit command line (converted first); -1 also when the
// conversion cannot be allocated.
INTN RunShellCommandAscii(const CHAR8 *CommandLine);

// True when the shell runs each Execute in a nested shell instance: its
// "nonesting" variable is present and not "True" (any case). Such a nested
// instance keeps a mapping table of its own.
bool ShellNestsCommands(EFI_SHELL_PROTOCOL *Shell);
// Carries out one of the image's own command lines ("map -u", "map -r",
// "map NAME TARGET:", "vol NAME:", "cd PATH", "cp [-q] SRC DST [> FILE]",
// "del [-q] PATH") on the shell's own protocol functions. False when the line
// is none of these (the caller then hands it to Execute); otherwise true with
// the command's status in *CommandStatus.
bool ShellRunBuiltin(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *CommandLine,
                     EFI_STATUS *CommandStatus);

// Console capture: ConOut and StdErr of the system table are switched to a
// capturing output until the capture ends. EFI_ALREADY_STARTED when a capture
// is active, EFI_UNSUPPORTED without a system table.
EFI_STATUS ConsoleCaptureBegin();
// Restores the console and returns the captured text (pool, caller frees;
// null when nothing was captured or no capture was active).
CHAR16 *ConsoleCaptureEnd();

// Refreshes the shell's mappings ("map -u", then "cd ostra1:\Tools") with the
// console captured.
void RefreshShellMappings();

// Reads the volume label of the file system on Handle into Label (at most
// NWFS_DRIVE_NAME_CHARS characters; Label holds NWFS_DRIVE_NAME_CHARS + 1).
EFI_STATUS GetVolume(EFI_HANDLE Handle, CHAR16 *Label);

// Finds the file-system volume whose label agrees with VolumeName in its
// first 6 characters, maps it in the shell and returns in DriveName the name
// it can be reached under. DriveName is left untouched (empty) when no volume
// matches.
EFI_STATUS GetFS_OLD_NWFS(const CHAR16 *VolumeName, CHAR16 *DriveName, UINTN DriveNameChars);

// The platform's partition label table: a label and the fixed shell name it
// is mapped to.
struct NWFS_PARTITION_LABEL {
  const CHAR16 *Label;
  const CHAR16 *MapName;
};
constexpr UINTN NWFS_PARTITION_LABEL_COUNT = 16;
extern const NWFS_PARTITION_LABEL gPartitionLabelTable[NWFS_PARTITION_LABEL_COUNT];
