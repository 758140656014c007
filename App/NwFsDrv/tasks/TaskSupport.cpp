// Text joining, the shell "system" call and the file existence check shared
// by the catalog, import and export tasks, and the mapping of the mounted
// share under its volume identifier.
#include "tasks/TaskSupport.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ShellCommand.h"
#include "Tasks.h"

namespace {

template <typename CharT>
UINTN TextLength(const CharT *Text) {
  UINTN Length = 0;
  while (Text != nullptr && Text[Length] != 0) {
    Length++;
  }
  return Length;
}

template <typename CharT>
CharT *JoinParts(const CharT *const *Parts, UINTN Count) {
  UINTN Total = 1;
  for (UINTN Index = 0; Index < Count; Index++) {
    Total += TextLength(Parts[Index]);
  }
  CharT *Joined = static_cast<CharT *>(AllocatePool(Total * sizeof(CharT)));
  if (Joined == nullptr) {
    return nullptr;
  }
  UINTN At = 0;
  for (UINTN Index = 0; Index < Count; Index++) {
    UINTN Length = TextLength(Parts[Index]);
    CopyMem(Joined + At, Parts[Index], Length * sizeof(CharT));
    At += Length;
  }
  Joined[At] = 0;
  return Joined;
}

// The runner's result as a status: the command's own status once the shell
// launched it, else the launch failure.
EFI_STATUS CommandOutcome(INTN RunnerResult) {
  if (RunnerResult == 1) {
    return EFI_INVALID_PARAMETER; // no command line at all
  }
  return gLastCommandStatus;
}

} // namespace

CHAR16 *JoinText(const CHAR16 *const *Parts, UINTN Count) {
  return JoinParts(Parts, Count);
}

CHAR8 *JoinAscii(const CHAR8 *const *Parts, UINTN Count) {
  return JoinParts(Parts, Count);
}

EFI_STATUS RunSystemCommand(const CHAR8 *CommandLine) {
  return CommandOutcome(RunShellCommandAscii(CommandLine));
}

EFI_STATUS RunSystemCommandW(const CHAR16 *CommandLine) {
  return CommandOutcome(RunShellCommand(CommandLine));
}

void PrintCommandStatus(EFI_STATUS Status, UINT32 Line) {
  DiagLog(DIAG_ALWAYS, "\n (%d)Status = [%d]\n", Line, static_cast<INT32>(Status));
}

namespace {

// Path opened for reading through the shell, or null.
SHELL_FILE_HANDLE OpenThroughShell(const CHAR16 *Path, EFI_SHELL_PROTOCOL **Shell) {
  *Shell = CurrentShell();
  SHELL_FILE_HANDLE File = nullptr;
  if (Path == nullptr || *Shell == nullptr || (*Shell)->OpenFileByName == nullptr ||
      (*Shell)->OpenFileByName(Path, &File, EFI_FILE_MODE_READ) != EFI_SUCCESS) {
    return nullptr;
  }
  return File;
}

} // namespace

bool ShellFileOpens(const CHAR16 *Path) {
  EFI_SHELL_PROTOCOL *Shell = nullptr;
  SHELL_FILE_HANDLE File = OpenThroughShell(Path, &Shell);
  if (File == nullptr) {
    return false;
  }
  Shell->CloseFile(File);
  return true;
}

bool ShellFileOpensAscii(const CHAR8 *Path) {
  CHAR16 *Wide = AsciiStrDupToUnicode(Path);
  bool Opens = Wide != nullptr && ShellFileOpens(Wide);
  FreePool(Wide);
  return Opens;
}

bool ShellFileSize(const CHAR16 *Path, UINT64 *Size) {
  EFI_SHELL_PROTOCOL *Shell = nullptr;
  SHELL_FILE_HANDLE File = OpenThroughShell(Path, &Shell);
  if (File == nullptr) {
    return false;
  }
  EFI_FILE_INFO *Info = Shell->GetFileInfo(File);
  Shell->CloseFile(File);
  if (Info == nullptr) {
    return false;
  }
  *Size = Info->FileSize;
  FreePool(Info);
  return true;
}

// ---------------------------------------------------------------------------
// Copies that must arrive whole
// ---------------------------------------------------------------------------

EFI_STATUS ConfirmCopy(bool SourceFound, UINT64 SourceSize, EFI_STATUS CommandStatus,
                       const CHAR16 *Destination) {
  UINT64 Arrived = 0;
  bool Present = ShellFileSize(Destination, &Arrived);
  if (SourceFound && !EFI_ERROR(CommandStatus) && Present && Arrived == SourceSize) {
    return EFI_SUCCESS;
  }
  // A copy that broke off leaves a short file behind, and one whose source
  // could not be found an empty one (the copy command makes the destination
  // first): nothing a failed copy left may pass for the file.
  if (SourceFound) {
    DiagLog(DIAG_ALWAYS, "\nCopy to %ls failed (%ld of %ld bytes, status 0x%x)\n", Destination,
            Arrived, SourceSize, static_cast<UINT32>(CommandStatus));
  }
  if (Present) {
    const CHAR16 *Parts[] = {u"del -q ", Destination};
    CHAR16 *Command = JoinText(Parts);
    if (Command != nullptr) {
      RunSystemCommandW(Command);
      FreePool(Command);
    }
  }
  return SourceFound ? EFI_DEVICE_ERROR : EFI_NOT_FOUND;
}

EFI_STATUS RunConfirmedCopy(const CHAR8 *CommandLine, const CHAR8 *Source,
                            const CHAR8 *Destination) {
  CHAR16 *WideSource = AsciiStrDupToUnicode(Source);
  CHAR16 *WideDestination = AsciiStrDupToUnicode(Destination);
  EFI_STATUS Status = EFI_OUT_OF_RESOURCES;
  if (WideSource != nullptr && WideDestination != nullptr) {
    UINT64 SourceSize = 0;
    bool SourceFound = ShellFileSize(WideSource, &SourceSize);
    Status = ConfirmCopy(SourceFound, SourceSize, RunSystemCommand(CommandLine), WideDestination);
  }
  FreePool(WideSource);
  FreePool(WideDestination);
  return Status;
}

// ---------------------------------------------------------------------------
// The mounted share's shell name
// ---------------------------------------------------------------------------

const CHAR16 *ShareVolumeIdentifier(UINT64 ShareType) {
  return ShareType == NWFS_SHARE_TYPE_CIFS ? u"CIFS" : u"NFS";
}

namespace {

// "map <Identifier> <DriveName>:", announced on the console. Null, after the
// allocation-failure line, when it cannot be allocated.
CHAR16 *BuildMapCommand(const CHAR16 *Identifier, const CHAR16 *DriveName) {
  constexpr const CHAR16 *kMap = u"map";
  // "map", the two spaces, the drive name, its colon and the terminator.
  UINTN Chars = StrLen(kMap) + StrLen(Identifier) + 2 + StrLen(DriveName) + 2;
  CHAR16 *Command = static_cast<CHAR16 *>(AllocateZeroPool(Chars * sizeof(CHAR16)));
  if (Command == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation error for Command \n");
    return nullptr;
  }
  UnicodeSPrint(Command, Chars, u"%s %s %s:", kMap, Identifier, DriveName);
  DiagLogW(DIAG_ALWAYS, u"trying to map --> command: %s\n", Command);
  return Command;
}

} // namespace

bool MapShareUnderIdentifier(const CHAR16 *Identifier, const SHARE_MAPPING_STYLE &Style,
                             CHAR16 (&DriveName)[NWFS_DRIVE_NAME_CHARS + 1], EFI_STATUS *Status) {
  ZeroMem(DriveName, sizeof(DriveName));
  if (Style.AfterMount) {
    RefreshShellMappings();
  }
  GetFS_OLD_NWFS(Identifier, DriveName, NWFS_DRIVE_NAME_CHARS);
  if (Style.AfterMount) {
    DiagLog(DIAG_VERBOSE, "driveName = %ls\n", DriveName);
  }
  if (DriveName[0] == 0) {
    if (Style.NoDriveText != nullptr) {
      DiagLog(DIAG_ALWAYS, Style.NoDriveText, DriveName);
    }
    if (EFI_ERROR(Style.NoDriveStatus)) {
      *Status = Style.NoDriveStatus;
      return false;
    }
    return true;
  }
  if (Style.AfterMount) {
    DiagLog(DIAG_VERBOSE, "NWPartitions = %ls\n", DriveName);
  }
  if (StrnCmp(DriveName, Identifier, StrLen(Identifier)) == 0) {
    return true; // already reachable under its identifier
  }

  CHAR16 *Command = BuildMapCommand(Identifier, DriveName);
  if (Command == nullptr) {
    *Status = Style.NoMemoryStatus;
    return false;
  }
  if (Style.CommandText != nullptr) {
    DiagLog(DIAG_ALWAYS, Style.CommandText, Command);
  }
  INTN RunnerResult = RunShellCommand(Command);
  bool Ends = RunnerResult != 0 && Style.FailureEnds;
  if (Ends) {
    if (Style.FailureText != nullptr) {
      DiagLogW(DIAG_ALWAYS, Style.FailureText, Command);
    }
    *Status = static_cast<EFI_STATUS>(RunnerResult);
    if (Style.FailureStatusLine) {
      PrintCommandStatus(*Status);
    }
  }
  FreePool(Command);
  return !Ends;
}
