// Running UEFI Shell commands: the shell binding, the console capture around
// commands, ExecuteShellCommand, the short command runner and the mapping
// refresh.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ShellCommand.h"

const EFI_GUID gNwShellEnvProtocolGuid = {
    0x47C7B221, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};
const EFI_GUID gNwShellInterfaceGuid = {
    0x47C7B223, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};
const EFI_GUID gNwShellMapGuid = {
    0x47C7B225, 0xC42A, 0x11D2, {0x8E, 0x57, 0x00, 0xA0, 0xC9, 0x69, 0x72, 0x3B}};

void *gShellEnvProtocol = nullptr;
EFI_HANDLE gShellEnv2Handle = nullptr;
EFI_SHELL_PROTOCOL *gShellEnv2 = nullptr;
BOOLEAN gShellEnv2Found = FALSE;
BOOLEAN gCheckToolsVolume = FALSE;
EFI_STATUS gLastCommandStatus = EFI_SUCCESS;

namespace {

constexpr const CHAR16 *kToolsCheckFile = u"ostra1:\\Tools\\KestGraphics.efi";
constexpr const CHAR16 *kToolsDirCommand = u"cd ostra1:\\Tools";
constexpr const CHAR16 *kMapUpdateCommand = u"map -u";
constexpr UINT32 kToolsCheckAttempts = 10;
constexpr UINTN kToolsCheckStallMicroseconds = 1000;

// ---------------------------------------------------------------------------
// Console capture
// ---------------------------------------------------------------------------
struct CAPTURE_OUTPUT {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL Protocol; // first: the record is the interface
  CHAR16 *Text;
  UINTN Length;   // characters, without the terminator
  UINTN Capacity; // characters, terminator included
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *SavedConOut;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *SavedStdErr;
  BOOLEAN Active;
};

EFI_STATUS EFIAPI CaptureReset(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, BOOLEAN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String);
EFI_STATUS EFIAPI CaptureTestString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, const CHAR16 *) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureQueryMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber,
                                   UINTN *Columns, UINTN *Rows);
EFI_STATUS EFIAPI CaptureSetMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureSetAttribute(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureClearScreen(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureSetCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN, UINTN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureEnableCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, BOOLEAN) {
  return EFI_SUCCESS;
}

SIMPLE_TEXT_OUTPUT_MODE gCaptureMode = {1, 0, 0x07, 0, 0, FALSE};

CAPTURE_OUTPUT gCapture = {{CaptureReset, CaptureOutputString, CaptureTestString, CaptureQueryMode,
                            CaptureSetMode, CaptureSetAttribute, CaptureClearScreen,
                            CaptureSetCursor, CaptureEnableCursor, &gCaptureMode},
                           nullptr,
                           0,
                           0,
                           nullptr,
                           nullptr,
                           FALSE};

EFI_STATUS EFIAPI CaptureOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  CAPTURE_OUTPUT *Capture = reinterpret_cast<CAPTURE_OUTPUT *>(This);
  if (String == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  UINTN Add = StrLen(String);
  if (Capture->Length + Add + 1 > Capture->Capacity) {
    UINTN NewCapacity = Capture->Capacity == 0 ? 256 : Capture->Capacity;
    while (NewCapacity < Capture->Length + Add + 1) {
      NewCapacity *= 2;
    }
    CHAR16 *Grown = static_cast<CHAR16 *>(AllocatePool(NewCapacity * sizeof(CHAR16)));
    if (Grown == nullptr) {
      return EFI_DEVICE_ERROR; // the text is lost, the command goes on
    }
    if (Capture->Text != nullptr) {
      CopyMem(Grown, Capture->Text, Capture->Length * sizeof(CHAR16));
      FreePool(Capture->Text);
    }
    Capture->Text = Grown;
    Capture->Capacity = NewCapacity;
  }
  CopyMem(Capture->Text + Capture->Length, String, Add * sizeof(CHAR16));
  Capture->Length += Add;
  Capture->Text[Capture->Length] = 0;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI CaptureQueryMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber,
                                   UINTN *Columns, UINTN *Rows) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *Saved = reinterpret_cast<CAPTURE_OUTPUT *>(This)->SavedConOut;
  if (Saved != nullptr && Saved->QueryMode != nullptr) {
    return Saved->QueryMode(Saved, ModeNumber, Columns, Rows);
  }
  if (Columns == nullptr || Rows == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  *Columns = 80;
  *Rows = 25;
  return EFI_SUCCESS;
}

// The system table's header checksum covers ConOut and StdErr.
void UpdateSystemTableCrc() {
  if (gBS == nullptr || gBS->CalculateCrc32 == nullptr || gST->Hdr.HeaderSize == 0) {
    return;
  }
  UINT32 Crc = 0;
  gST->Hdr.CRC32 = 0;
  if (gBS->CalculateCrc32(gST, gST->Hdr.HeaderSize, &Crc) == EFI_SUCCESS) {
    gST->Hdr.CRC32 = Crc;
  }
}

// ---------------------------------------------------------------------------
// Shell execution
// ---------------------------------------------------------------------------

} // namespace

EFI_SHELL_PROTOCOL *CurrentShell() {
  if (gShellEnv2Found) {
    return gShellEnv2;
  }
  EFI_SHELL_PROTOCOL *Shell = nullptr;
  if (gBS == nullptr || gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr,
                                            reinterpret_cast<void **>(&Shell)) != EFI_SUCCESS) {
    return nullptr;
  }
  return Shell;
}

namespace {

// One command: carried out in the image when the shell would run it in a
// nested instance (whose mappings are not the caller's) and the image knows
// it, else one Execute call (parent image handle, command line, no
// environment). The return value is the launch status; CommandStatus the
// command's own.
EFI_STATUS ShellExecute(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *CommandLine,
                        EFI_STATUS *CommandStatus) {
  *CommandStatus = EFI_SUCCESS;
  if (Shell == nullptr || Shell->Execute == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (ShellNestsCommands(Shell) && ShellRunBuiltin(Shell, CommandLine, CommandStatus)) {
    return EFI_SUCCESS;
  }
  // Execute takes a writable line; hand it a copy.
  CHAR16 *Line = StrDup(CommandLine);
  if (Line == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Launch = Shell->Execute(&gImageHandle, Line, nullptr, CommandStatus);
  FreePool(Line);
  return Launch;
}

// Launch status if the launch failed, else the command's status.
EFI_STATUS ShellExecuteStatus(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *CommandLine) {
  EFI_STATUS CommandStatus;
  EFI_STATUS Launch = ShellExecute(Shell, CommandLine, &CommandStatus);
  return EFI_ERROR(Launch) ? Launch : CommandStatus;
}

bool ToolsFileOpens(EFI_SHELL_PROTOCOL *Shell) {
  SHELL_FILE_HANDLE File = nullptr;
  if (Shell->OpenFileByName == nullptr ||
      Shell->OpenFileByName(kToolsCheckFile, &File, EFI_FILE_MODE_READ) != EFI_SUCCESS) {
    return false;
  }
  Shell->CloseFile(File);
  return true;
}

// Makes sure the tools volume is reachable before a command. Only runs when
// gCheckToolsVolume is set, which nothing does: kept for platforms that ship
// the tools partition. The inner commands go straight to the shell so that
// they do not re-enter this check.
void CheckToolsVolume(EFI_SHELL_PROTOCOL *Shell) {
  for (UINT32 Attempt = 0; Attempt < kToolsCheckAttempts; Attempt++) {
    if (ToolsFileOpens(Shell)) {
      return;
    }
    DiagLogW(DIAG_ALWAYS, u"File %s can't be opened! Mapping again!\n", kToolsCheckFile);
    gBS->Stall(kToolsCheckStallMicroseconds);
    bool Started = ConsoleCaptureBegin() == EFI_SUCCESS;
    EFI_STATUS Status = ShellExecuteStatus(Shell, kMapUpdateCommand);
    if (!EFI_ERROR(Status)) {
      Status = ShellExecuteStatus(Shell, kToolsDirCommand);
    }
    DiagLog(DIAG_VERBOSE, "Status = %d\n", static_cast<INT32>(Status));
    if (Started) {
      FreePool(ConsoleCaptureEnd());
    }
  }
}

} // namespace

EFI_STATUS ConsoleCaptureBegin() {
  if (gST == nullptr) {
    return EFI_UNSUPPORTED;
  }
  if (gCapture.Active) {
    return EFI_ALREADY_STARTED;
  }
  gCapture.SavedConOut = gST->ConOut;
  gCapture.SavedStdErr = gST->StdErr;
  gCapture.Protocol.Mode =
      gST->ConOut != nullptr && gST->ConOut->Mode != nullptr ? gST->ConOut->Mode : &gCaptureMode;
  gCapture.Text = nullptr;
  gCapture.Length = 0;
  gCapture.Capacity = 0;
  gCapture.Active = TRUE;
  gST->ConOut = &gCapture.Protocol;
  gST->StdErr = &gCapture.Protocol;
  UpdateSystemTableCrc();
  return EFI_SUCCESS;
}

CHAR16 *ConsoleCaptureEnd() {
  if (!gCapture.Active || gST == nullptr) {
    return nullptr;
  }
  gST->ConOut = gCapture.SavedConOut;
  gST->StdErr = gCapture.SavedStdErr;
  UpdateSystemTableCrc();
  gCapture.Active = FALSE;
  CHAR16 *Text = gCapture.Text;
  gCapture.Text = nullptr;
  gCapture.Length = 0;
  gCapture.Capacity = 0;
  return Text;
}

EFI_STATUS LocateShellEnvironment(const CHAR8 *Function, UINT32 Line) {
  gShellEnvProtocol = nullptr;
  if (gBS == nullptr) {
    return EFI_NOT_READY;
  }
  EFI_STATUS Status = gBS->LocateProtocol(&gNwShellEnvProtocolGuid, nullptr, &gShellEnvProtocol);
  if (Status == EFI_NOT_FOUND) {
    DiagError("\nlocate protocol failed!", Status, Function, Line);
  } else if (EFI_ERROR(Status)) {
    DiagError("\nLocate Protocol Failed!", Status, Function, Line);
  }
  return Status;
}

EFI_STATUS InitializeSystemEnv(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  DiagLog(4, "Entering into InitializeSystemEnv() function\n");
  if (SystemTable != nullptr) {
    gImageHandle = ImageHandle;
    gST = SystemTable;
    gBS = SystemTable->BootServices;
    gRT = SystemTable->RuntimeServices;
  }
  gShellEnv2Found = FALSE;
  gShellEnv2Handle = nullptr;
  gShellEnv2 = nullptr;

  EFI_STATUS Status = EFI_NOT_READY;
  UINTN Count = 0;
  EFI_HANDLE *Handles = nullptr;
  if (gBS != nullptr) {
    Status = gBS->LocateHandleBuffer(ByProtocol, &gEfiShellProtocolGuid, nullptr, &Count, &Handles);
  }
  if (!EFI_ERROR(Status)) {
    Status = EFI_NOT_FOUND;
    for (UINTN Index = 0; Index < Count && !gShellEnv2Found; Index++) {
      EFI_SHELL_PROTOCOL *Shell = nullptr;
      if (gBS->HandleProtocol(Handles[Index], &gEfiShellProtocolGuid,
                              reinterpret_cast<void **>(&Shell)) != EFI_SUCCESS ||
          Shell == nullptr || Shell->MajorVersion < 1) {
        continue;
      }
      gShellEnv2Handle = Handles[Index];
      gShellEnv2 = Shell;
      gShellEnv2Found = TRUE;
      Status = EFI_SUCCESS;
    }
    FreePool(Handles);
  }
  if (!gShellEnv2Found) {
    DiagLog(4, "Initialization of shell environment 2 failed, Status: %d \n",
            static_cast<INT32>(Status));
  }
  DiagLog(4, "Exiting from InitializeSystemEnv() function\n");
  return Status;
}

EFI_STATUS ExecuteShellCommand(const CHAR16 *CommandLine) {
  DiagLog(DIAG_TRACE, "Entering into ExecuteShellCommand() function\n");
  if (CommandLine == nullptr || !gShellEnv2Found) {
    // Deliberately handed to the 8-bit print although the text is UCS-2: the
    // console shows only its first letter.
    DiagLog(DIAG_ALWAYS, reinterpret_cast<const CHAR8 *>(
                             u"Command  is NULL or Shell Environment 2 was not properly "
                             u"initialized.\n"));
    return EFI_INVALID_PARAMETER;
  }
  if (gCheckToolsVolume) {
    CheckToolsVolume(gShellEnv2);
  }
  EFI_STATUS Status = ShellExecuteStatus(gShellEnv2, CommandLine);
  if (!EFI_ERROR(Status)) {
    DiagLog(DIAG_VERBOSE, "\nCommand Success: ..\n");
  } else {
    DiagLog(DIAG_ALWAYS, "\nCommand Failed: Status = %d\n", static_cast<INT32>(Status));
  }
  DiagLog(DIAG_TRACE, "Exiting from ExecuteShellCommand() function. Status = %d\n",
          static_cast<INT32>(Status));
  return Status;
}

INTN RunShellCommand(const CHAR16 *CommandLine) {
  if (CommandLine == nullptr) {
    return 1;
  }
  EFI_STATUS CommandStatus;
  EFI_STATUS Launch = ShellExecute(CurrentShell(), CommandLine, &CommandStatus);
  gLastCommandStatus = EFI_ERROR(Launch) ? Launch : CommandStatus;
  return EFI_ERROR(Launch) ? -1 : 0;
}

INTN RunShellCommandAscii(const CHAR8 *CommandLine) {
  if (CommandLine == nullptr) {
    return 1;
  }
  CHAR16 *Wide = AsciiStrDupToUnicode(CommandLine);
  if (Wide == nullptr) {
    gLastCommandStatus = EFI_OUT_OF_RESOURCES;
    return -1;
  }
  INTN Result = RunShellCommand(Wide);
  FreePool(Wide);
  return Result;
}

void RefreshShellMappings() {
  bool Started = ConsoleCaptureBegin() == EFI_SUCCESS;
  // A failing "map -u" would go to the platform's error log if one were
  // registered; this image registers none.
  if (!EFI_ERROR(ExecuteShellCommand(kMapUpdateCommand))) {
    ExecuteShellCommand(kToolsDirCommand);
  }
  if (Started) {
    FreePool(ConsoleCaptureEnd());
  }
}
