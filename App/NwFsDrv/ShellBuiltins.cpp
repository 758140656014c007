// The image's own shell commands run inside the image. A shell that nests
// runs every Execute in a fresh shell instance with a mapping table of its
// own: names given there never reach the shell that started the image, and
// names given there by the image or its startup script are unknown to the
// nested instance. On such a shell the few commands the image issues ("map",
// "vol", "cd", "cp", "del") are carried out here on the calling shell's own
// protocol functions instead; anything else still goes to Execute.
#include "NwBaseLib.h"
#include "ShellCommand.h"

namespace {

constexpr UINTN kMaxWords = 8;
constexpr UINTN kCopyChunkBytes = 128 * 1024;
constexpr UINTN kMapNameChars = 16;
constexpr UINTN kReportChars = 512;
constexpr UINT64 kCreateMode = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE | EFI_FILE_MODE_CREATE;

CHAR16 Upper(CHAR16 C) {
  return C >= u'a' && C <= u'z' ? static_cast<CHAR16>(C - u'a' + u'A') : C;
}

bool SameText(const CHAR16 *A, const CHAR16 *B) {
  for (; *A != 0 && Upper(*A) == Upper(*B); A++, B++) {
  }
  return Upper(*A) == Upper(*B);
}

// The command line split at blanks, in place. The image builds its lines
// without quotes, so none are interpreted.
struct COMMAND_WORDS {
  CHAR16 *Line;
  CHAR16 *Word[kMaxWords];
  UINTN Count;
};

bool SplitWords(const CHAR16 *CommandLine, COMMAND_WORDS *Words) {
  Words->Count = 0;
  Words->Line = StrDup(CommandLine);
  if (Words->Line == nullptr) {
    return false;
  }
  CHAR16 *At = Words->Line;
  while (*At != 0) {
    while (*At == u' ' || *At == u'\t') {
      *At++ = 0;
    }
    if (*At == 0) {
      break;
    }
    if (Words->Count == kMaxWords) {
      return false; // longer than any line the image builds
    }
    Words->Word[Words->Count++] = At;
    while (*At != 0 && *At != u' ' && *At != u'\t') {
      At++;
    }
  }
  return true;
}

// The text after the last '\' or ':' of a path.
const CHAR16 *LastComponent(const CHAR16 *Path) {
  const CHAR16 *Name = Path;
  for (const CHAR16 *At = Path; *At != 0; At++) {
    if (*At == u'\\' || *At == u':') {
      Name = At + 1;
    }
  }
  return Name;
}

// ---------------------------------------------------------------------------
// map, vol, cd, del
// ---------------------------------------------------------------------------

// Gives every file system without a shell name the next free "FSn:".
EFI_STATUS MapUnmappedVolumes(EFI_SHELL_PROTOCOL *Shell) {
  UINTN Count = 0;
  EFI_HANDLE *Handles = nullptr;
  EFI_STATUS Status = gBS->LocateHandleBuffer(ByProtocol, &gEfiSimpleFileSystemProtocolGuid,
                                              nullptr, &Count, &Handles);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  UINTN Next = 0;
  for (UINTN Index = 0; Index < Count; Index++) {
    EFI_DEVICE_PATH_PROTOCOL *Path = nullptr;
    if (gBS->HandleProtocol(Handles[Index], &gEfiDevicePathProtocolGuid,
                            reinterpret_cast<void **>(&Path)) != EFI_SUCCESS ||
        Path == nullptr) {
      continue;
    }
    EFI_DEVICE_PATH_PROTOCOL *Cursor = Path; // the lookup moves it
    if (Shell->GetMapFromDevicePath(&Cursor) != nullptr) {
      continue;
    }
    CHAR16 Name[kMapNameChars];
    do {
      UnicodeSPrint(Name, kMapNameChars, u"FS%d:", static_cast<INT32>(Next++));
    } while (Shell->GetDevicePathFromMap(Name) != nullptr);
    // The shell wants the name with its trailing colon.
    Shell->SetMap(Path, Name);
  }
  FreePool(Handles);
  return EFI_SUCCESS;
}

// "map NAME TARGET": the volume TARGET names gets NAME as well.
EFI_STATUS MapAlias(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *Name, const CHAR16 *Target) {
  const EFI_DEVICE_PATH_PROTOCOL *Path = Shell->GetDevicePathFromMap(Target);
  if (Path == nullptr) {
    return EFI_NOT_FOUND;
  }
  CHAR16 Alias[NWFS_DRIVE_NAME_CHARS + 2];
  UINTN Length = StrLen(Name);
  if (Length == 0 || Length > NWFS_DRIVE_NAME_CHARS) {
    return EFI_INVALID_PARAMETER;
  }
  StrCpyS(Alias, NWFS_DRIVE_NAME_CHARS + 2, Name);
  if (Alias[Length - 1] != u':') {
    StrCatS(Alias, NWFS_DRIVE_NAME_CHARS + 2, u":");
  }
  return Shell->SetMap(Path, Alias);
}

// "vol NAME:": the volume's root opens and answers for its file-system
// information.
EFI_STATUS CheckVolume(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *Name) {
  const EFI_DEVICE_PATH_PROTOCOL *Mapped = Shell->GetDevicePathFromMap(Name);
  if (Mapped == nullptr) {
    return EFI_NOT_FOUND;
  }
  EFI_DEVICE_PATH_PROTOCOL *Path = const_cast<EFI_DEVICE_PATH_PROTOCOL *>(Mapped);
  EFI_HANDLE Device = nullptr;
  EFI_STATUS Status = gBS->LocateDevicePath(&gEfiSimpleFileSystemProtocolGuid, &Path, &Device);
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Fs = nullptr;
  if (!EFI_ERROR(Status)) {
    Status = gBS->HandleProtocol(Device, &gEfiSimpleFileSystemProtocolGuid,
                                 reinterpret_cast<void **>(&Fs));
  }
  EFI_FILE_PROTOCOL *Root = nullptr;
  if (!EFI_ERROR(Status)) {
    Status = Fs->OpenVolume(Fs, &Root);
  }
  if (EFI_ERROR(Status) || Root == nullptr) {
    return EFI_ERROR(Status) ? Status : EFI_DEVICE_ERROR;
  }
  UINTN Size = 0;
  Root->GetInfo(Root, &gEfiFileSystemInfoGuid, &Size, nullptr);
  void *Info = Size != 0 ? AllocateZeroPool(Size) : nullptr;
  if (Info != nullptr) {
    Root->GetInfo(Root, &gEfiFileSystemInfoGuid, &Size, Info); // shown by nobody
    FreePool(Info);
  }
  Root->Close(Root);
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// cp
// ---------------------------------------------------------------------------

bool IsDirectory(EFI_SHELL_PROTOCOL *Shell, SHELL_FILE_HANDLE File) {
  EFI_FILE_INFO *Info = Shell->GetFileInfo(File);
  bool Directory = Info != nullptr && (Info->Attribute & EFI_FILE_DIRECTORY) != 0;
  FreePool(Info);
  return Directory;
}

// The destination file's path: the source's name is appended when the
// destination names a directory (ends in '\' or ':', or is one).
CHAR16 *DestinationPath(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *Source, const CHAR16 *Target) {
  UINTN Length = StrLen(Target);
  bool Directory = Length > 0 && (Target[Length - 1] == u'\\' || Target[Length - 1] == u':');
  if (!Directory) {
    SHELL_FILE_HANDLE Existing = nullptr;
    if (Shell->OpenFileByName(Target, &Existing, EFI_FILE_MODE_READ) == EFI_SUCCESS &&
        Existing != nullptr) {
      Directory = IsDirectory(Shell, Existing);
      Shell->CloseFile(Existing);
    }
    if (!Directory) {
      return StrDup(Target);
    }
  }
  const CHAR16 *Name = LastComponent(Source);
  UINTN Chars = Length + 1 + StrLen(Name) + 1;
  CHAR16 *Path = static_cast<CHAR16 *>(AllocateZeroPool(Chars * sizeof(CHAR16)));
  if (Path != nullptr) {
    StrCpyS(Path, Chars, Target);
    if (Target[Length - 1] != u'\\' && Target[Length - 1] != u':') {
      StrCatS(Path, Chars, u"\\");
    }
    StrCatS(Path, Chars, Name);
  }
  return Path;
}

EFI_STATUS CopyContents(EFI_SHELL_PROTOCOL *Shell, SHELL_FILE_HANDLE From, SHELL_FILE_HANDLE To) {
  void *Buffer = AllocatePool(kCopyChunkBytes);
  if (Buffer == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = EFI_SUCCESS;
  for (;;) {
    UINTN Read = kCopyChunkBytes;
    Status = Shell->ReadFile(From, &Read, Buffer);
    if (EFI_ERROR(Status) || Read == 0) {
      break;
    }
    UINTN Written = Read;
    Status = Shell->WriteFile(To, &Written, Buffer);
    if (!EFI_ERROR(Status) && Written != Read) {
      Status = EFI_DEVICE_ERROR;
    }
    if (EFI_ERROR(Status)) {
      break;
    }
  }
  FreePool(Buffer);
  return Status;
}

EFI_STATUS CopyFile(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *Source, const CHAR16 *Target) {
  SHELL_FILE_HANDLE From = nullptr;
  EFI_STATUS Status = Shell->OpenFileByName(Source, &From, EFI_FILE_MODE_READ);
  if (EFI_ERROR(Status) || From == nullptr) {
    return EFI_ERROR(Status) ? Status : EFI_NOT_FOUND;
  }
  if (IsDirectory(Shell, From)) {
    Shell->CloseFile(From);
    return EFI_INVALID_PARAMETER; // directories are not copied
  }
  CHAR16 *Destination = DestinationPath(Shell, Source, Target);
  if (Destination == nullptr) {
    Shell->CloseFile(From);
    return EFI_OUT_OF_RESOURCES;
  }
  Shell->DeleteFileByName(Destination); // a missing destination is fine
  SHELL_FILE_HANDLE To = nullptr;
  Status = Shell->OpenFileByName(Destination, &To, kCreateMode);
  if (!EFI_ERROR(Status) && To != nullptr) {
    Status = CopyContents(Shell, From, To);
    Shell->CloseFile(To);
  } else if (!EFI_ERROR(Status)) {
    Status = EFI_DEVICE_ERROR;
  }
  Shell->CloseFile(From);
  FreePool(Destination);
  return Status;
}

// The redirection target of "cp ... > FILE" receives a short UCS-2 account
// of the copy, byte order mark first.
void WriteCopyReport(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *ReportPath, const CHAR16 *Source,
                     const CHAR16 *Target, EFI_STATUS Status) {
  CHAR16 *Text = static_cast<CHAR16 *>(AllocateZeroPool(kReportChars * sizeof(CHAR16)));
  if (Text == nullptr) {
    return;
  }
  if (EFI_ERROR(Status)) {
    UnicodeSPrint(Text, kReportChars,
                  u"\xFEFF"
                  u"Copying %s -> %s - [Failed: status 0x%x]\r\n",
                  Source, Target, static_cast<UINT32>(Status));
  } else {
    UnicodeSPrint(Text, kReportChars,
                  u"\xFEFF"
                  u"Copying %s -> %s - [ok]\r\n",
                  Source, Target);
  }
  Shell->DeleteFileByName(ReportPath);
  SHELL_FILE_HANDLE Report = nullptr;
  if (Shell->OpenFileByName(ReportPath, &Report, kCreateMode) == EFI_SUCCESS && Report != nullptr) {
    UINTN Bytes = StrLen(Text) * sizeof(CHAR16);
    Shell->WriteFile(Report, &Bytes, Text);
    Shell->CloseFile(Report);
  }
  FreePool(Text);
}

bool IsQuietFlag(const CHAR16 *Word) {
  return SameText(Word, u"-q");
}

// "cp [-q] SRC DST [> FILE]"; false for any other form.
bool RunCopy(EFI_SHELL_PROTOCOL *Shell, COMMAND_WORDS *Words, EFI_STATUS *CommandStatus) {
  UINTN First = Words->Count > 1 && IsQuietFlag(Words->Word[1]) ? 2 : 1;
  UINTN Count = Words->Count - First;
  const CHAR16 *Report = nullptr;
  if (Count == 4 && StrCmp(Words->Word[First + 2], u">") == 0) {
    Report = Words->Word[First + 3];
  } else if (Count != 2) {
    return false;
  }
  const CHAR16 *Source = Words->Word[First];
  const CHAR16 *Target = Words->Word[First + 1];
  for (const CHAR16 *At = Source; *At != 0; At++) {
    if (*At == u'*' || *At == u'?' || *At == u'[') {
      return false; // patterns are the shell's business
    }
  }
  if (Source[0] == u'-' || Target[0] == u'-') {
    return false;
  }
  *CommandStatus = CopyFile(Shell, Source, Target);
  if (Report != nullptr) {
    WriteCopyReport(Shell, Report, Source, Target, *CommandStatus);
  }
  return true;
}

bool RunWords(EFI_SHELL_PROTOCOL *Shell, COMMAND_WORDS *Words, EFI_STATUS *CommandStatus) {
  if (Words->Count == 0) {
    return false;
  }
  const CHAR16 *Command = Words->Word[0];
  CHAR16 **Args = Words->Word + 1;
  const UINTN ArgCount = Words->Count - 1;
  if (SameText(Command, u"map")) {
    if (ArgCount == 1 && (SameText(Args[0], u"-u") || SameText(Args[0], u"-r"))) {
      *CommandStatus = MapUnmappedVolumes(Shell);
      return true;
    }
    if (ArgCount == 2 && Args[0][0] != u'-') {
      *CommandStatus = MapAlias(Shell, Args[0], Args[1]);
      return true;
    }
    return false;
  }
  if (SameText(Command, u"vol") && ArgCount == 1) {
    *CommandStatus = CheckVolume(Shell, Args[0]);
    return true;
  }
  if (SameText(Command, u"cd") && ArgCount == 1) {
    *CommandStatus = Shell->SetCurDir(nullptr, Args[0]);
    return true;
  }
  if (SameText(Command, u"cp")) {
    return RunCopy(Shell, Words, CommandStatus);
  }
  if (SameText(Command, u"del")) {
    UINTN First = ArgCount > 0 && IsQuietFlag(Args[0]) ? 1 : 0;
    if (ArgCount - First != 1 || Args[First][0] == u'-') {
      return false;
    }
    *CommandStatus = Shell->DeleteFileByName(Args[First]);
    return true;
  }
  return false;
}

} // namespace

bool ShellNestsCommands(EFI_SHELL_PROTOCOL *Shell) {
  if (Shell == nullptr || Shell->GetEnv == nullptr) {
    return false;
  }
  const CHAR16 *NoNesting = Shell->GetEnv(u"nonesting");
  return NoNesting != nullptr && !SameText(NoNesting, u"True");
}

bool ShellRunBuiltin(EFI_SHELL_PROTOCOL *Shell, const CHAR16 *CommandLine,
                     EFI_STATUS *CommandStatus) {
  if (Shell == nullptr || CommandLine == nullptr || gBS == nullptr) {
    return false;
  }
  COMMAND_WORDS Words;
  bool Ran = SplitWords(CommandLine, &Words) && RunWords(Shell, &Words, CommandStatus);
  FreePool(Words.Line);
  return Ran;
}
