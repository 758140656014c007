// The image entry proper: firmware tables, the image's protocols, the command
// line from the shell, main, and the driver unload.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ShellCommand.h"

namespace {

// The leading fields of the older shell interface protocol: all the entry
// needs of it is the command line.
struct NWFS_SHELL_INTERFACE {
  EFI_HANDLE ImageHandle;
  EFI_LOADED_IMAGE_PROTOCOL *Info;
  CHAR16 **Argv;
  UINTN Argc;
};
static_assert(offsetof(NWFS_SHELL_INTERFACE, Argv) == 16, "shell interface Argv");
static_assert(offsetof(NWFS_SHELL_INTERFACE, Argc) == 24, "shell interface Argc");

// The UCS-2 command line as 8-bit copies, null-terminated. An argument that
// is missing (or a missing vector) or cannot be copied stays null and is
// refused by the argument check.
CHAR8 **NarrowArguments(UINTN Argc, CHAR16 **Argv) {
  CHAR8 **Narrow = static_cast<CHAR8 **>(AllocateZeroPool((Argc + 1) * sizeof(CHAR8 *)));
  if (Narrow == nullptr) {
    return nullptr;
  }
  for (UINTN Index = 0; Index < Argc; Index++) {
    const CHAR16 *Wide = Argv != nullptr ? Argv[Index] : nullptr;
    Narrow[Index] = Wide != nullptr ? UnicodeStrDupToAscii(Wide) : nullptr;
  }
  return Narrow;
}

// The command line carries the password: the copies are cleared before they
// go back to the pool.
void FreeArguments(UINTN Argc, CHAR8 **Argv) {
  for (UINTN Index = 0; Argv != nullptr && Index < Argc; Index++) {
    FreeClearedAsciiStr(Argv[Index]);
  }
  FreePool(Argv);
}

INT32 RunMain(UINTN Argc, CHAR16 **Argv) {
  CHAR8 **Narrow = NarrowArguments(Argc, Argv);
  if (Narrow == nullptr) {
    DiagError("\nCopying the command line failed!", EFI_OUT_OF_RESOURCES, "ShellCEntryLib");
    return -1;
  }
  INT32 Result = App::main(static_cast<INTN>(Argc), Narrow);
  FreeArguments(Argc, Narrow);
  return Result;
}

// Finds the command line (shell parameters, else the older shell interface)
// and runs main with it. Without either, main is skipped and the run counts
// as failed.
INT32 RunMainFromShell(EFI_HANDLE ImageHandle) {
  EFI_SHELL_PARAMETERS_PROTOCOL *Parameters = nullptr;
  if (gBS->OpenProtocol(ImageHandle, &gEfiShellParametersProtocolGuid,
                        reinterpret_cast<void **>(&Parameters), ImageHandle, nullptr,
                        EFI_OPEN_PROTOCOL_GET_PROTOCOL) == EFI_SUCCESS &&
      Parameters != nullptr) {
    return RunMain(Parameters->Argc, Parameters->Argv);
  }
  NWFS_SHELL_INTERFACE *Interface = nullptr;
  if (gBS->OpenProtocol(ImageHandle, &gNwShellInterfaceGuid, reinterpret_cast<void **>(&Interface),
                        ImageHandle, nullptr, EFI_OPEN_PROTOCOL_GET_PROTOCOL) == EFI_SUCCESS &&
      Interface != nullptr) {
    return RunMain(Interface->Argc, Interface->Argv);
  }
  DiagLog(DIAG_ALWAYS, "ASSERT [CIFSDrv] App/NwFsDrv/FileSystem/ShellCEntryLib.cpp(%d): %a\n",
          __LINE__, "no shell parameters and no shell interface on the image handle");
  return -1;
}

} // namespace

EFI_STATUS ShellCEntryLib(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  if (SystemTable == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  gImageHandle = ImageHandle;
  gST = SystemTable;
  gBS = SystemTable->BootServices;
  gRT = SystemTable->RuntimeServices;

  InstallImageProtocols(ImageHandle);
  LocateShellEnvironment("ShellCEntryLib");

  EFI_LOADED_IMAGE_PROTOCOL *LoadedImage = nullptr;
  EFI_STATUS Status = gBS->OpenProtocol(ImageHandle, &gEfiLoadedImageProtocolGuid,
                                        reinterpret_cast<void **>(&LoadedImage), ImageHandle,
                                        nullptr, EFI_OPEN_PROTOCOL_GET_PROTOCOL);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  INT32 Result = RunMainFromShell(ImageHandle);
  UnloadSimpleFileSystemDriver(ImageHandle);
  return Result != 0 ? EFI_UNSUPPORTED : EFI_SUCCESS;
}
