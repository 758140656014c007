// The mini shell's commands: map, vol, cd, ls, cp, del and echo. They reach
// volumes only through EFI_FILE_PROTOCOL and print through the system
// table's ConOut (ShellOut), so redirection and callers' captures see them.
#include "HostShellInternal.h"

#include <algorithm>

namespace {

// cp moves data in blocks of the size the reference firmware's shell uses for
// its file operations (128 KiB).
constexpr UINTN kCopyChunk = 0x20000;

constexpr UINT64 kRead = EFI_FILE_MODE_READ;
constexpr UINT64 kReadWrite = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;
constexpr UINT64 kCreate = kReadWrite | EFI_FILE_MODE_CREATE;

EFI_STATUS Fail(const std::u16string &Message, EFI_STATUS Status) {
  ShellOut(Message + u"\r\n");
  return Status;
}

bool IsDirectory(const std::vector<UINT8> &Info) {
  return (ShellFileInfo(Info)->Attribute & EFI_FILE_DIRECTORY) != 0;
}

std::u16string InfoName(const std::vector<UINT8> &Info) {
  return std::u16string(ShellFileInfo(Info)->FileName);
}

// Opens Path and reads its EFI_FILE_INFO; the handle is closed again unless
// the caller asks for it.
EFI_STATUS Probe(const std::u16string &Path, UINT64 Mode, std::vector<UINT8> *Info,
                 EFI_FILE_PROTOCOL **Keep = nullptr) {
  EFI_FILE_PROTOCOL *File = nullptr;
  EFI_STATUS Status = ShellOpen(Path, Mode, 0, &File);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = ShellGetInfo(File, gEfiFileInfoGuid, Info);
  if (Keep != nullptr && !EFI_ERROR(Status)) {
    *Keep = File;
  } else {
    File->Close(File);
  }
  return Status;
}

// ---------------------------------------------------------------------------
// echo
// ---------------------------------------------------------------------------
EFI_STATUS CommandEcho(const ShellArgs &Args) {
  std::u16string Line;
  for (const std::u16string &Word : Args.Operands) {
    Line += (Line.empty() ? u"" : u" ") + Word;
  }
  ShellOut(Line + u"\r\n");
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// map
// ---------------------------------------------------------------------------
void PrintMapping(const ShellMapping &Mapping) {
  ShellOut(Mapping.Name + u": " +
           HostDevicePathText(
               reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(Mapping.DevicePath.data())) +
           u"\r\n");
}

void PrintMappingTable() {
  ShellOut(u"Mapping table\r\n");
  for (const ShellMapping &Mapping : ShellMappings()) {
    PrintMapping(Mapping);
  }
}

bool ValidMapName(const std::u16string &Name) {
  return !Name.empty() && std::all_of(Name.begin(), Name.end(), [](char16_t C) {
    return (C >= u'0' && C <= u'9') || (C >= u'a' && C <= u'z') || (C >= u'A' && C <= u'Z');
  });
}

// map [-r] [-u] | map -d NAME | map NAME | map NAME TARGET
EFI_STATUS CommandMap(const ShellArgs &Args) {
  if (Args.Has(u'd')) {
    const ShellMapping *Mapping =
        Args.Operands.size() == 1 ? ShellMapFind(Args.Operands[0]) : nullptr;
    if (Mapping == nullptr) {
      return Fail(u"map: -d needs the name of one mapping", EFI_INVALID_PARAMETER);
    }
    if (EFI_ERROR(ShellMapDelete(Mapping->Name))) {
      return Fail(u"map: Cannot find mapping '" + Args.Operands[0] + u"'", EFI_INVALID_PARAMETER);
    }
    return EFI_SUCCESS;
  }
  if (Args.Has(u'r')) {
    ShellMapRefresh(true);
  }
  if (Args.Has(u'u')) {
    ShellMapRefresh(false);
  }
  if (Args.Operands.empty()) {
    PrintMappingTable();
    return EFI_SUCCESS;
  }
  if (Args.Operands.size() == 1) {
    const ShellMapping *Mapping = ShellMapFind(Args.Operands[0]);
    if (Mapping == nullptr) {
      return Fail(u"map: Cannot find mapping '" + Args.Operands[0] + u"'", EFI_NOT_FOUND);
    }
    PrintMapping(*Mapping);
    return EFI_SUCCESS;
  }
  std::u16string Name = Args.Operands[0];
  if (!Name.empty() && Name.back() == u':') {
    Name.pop_back();
  }
  if (!ValidMapName(Name)) {
    return Fail(u"map: '" + Args.Operands[0] + u"' is not a valid mapping name",
                EFI_INVALID_PARAMETER);
  }
  const ShellMapping *Target = ShellMapFind(Args.Operands[1]);
  if (Target == nullptr) {
    return Fail(u"map: Cannot find mapping '" + Args.Operands[1] + u"'", EFI_INVALID_PARAMETER);
  }
  std::vector<UINT8> DevicePath = Target->DevicePath; // Add may move the table
  return ShellMapAdd(Name, DevicePath);
}

// ---------------------------------------------------------------------------
// vol
// ---------------------------------------------------------------------------
EFI_STATUS CommandVol(const ShellArgs &Args) {
  std::u16string Name = Args.Operands.empty() ? ShellCurrentMapping() : Args.Operands[0];
  const ShellMapping *Mapping = ShellMapFind(Name);
  if (Mapping == nullptr) {
    return Fail(u"vol: Cannot find mapping '" + Name + u"'", EFI_NOT_FOUND);
  }
  EFI_FILE_PROTOCOL *Root = nullptr;
  EFI_STATUS Status = ShellOpenMappingRoot(*Mapping, &Root);
  if (EFI_ERROR(Status)) {
    return Fail(u"vol: Cannot open the volume " + Mapping->Name + u":", Status);
  }
  std::vector<UINT8> Info;
  Status = ShellGetInfo(Root, gEfiFileSystemInfoGuid, &Info);
  Root->Close(Root);
  if (EFI_ERROR(Status)) {
    return Fail(u"vol: Cannot read the volume information", Status);
  }
  const EFI_FILE_SYSTEM_INFO *Fs = reinterpret_cast<const EFI_FILE_SYSTEM_INFO *>(Info.data());
  ShellOut(u"Volume " + std::u16string(Fs->VolumeLabel) + (Fs->ReadOnly ? u" (ro)" : u" (rw)") +
           u"\r\n" + HostDecimal(Fs->VolumeSize) + u" bytes total disk space\r\n" +
           HostDecimal(Fs->FreeSpace) + u" bytes available on disk\r\n" +
           HostDecimal(Fs->BlockSize) + u" bytes in each allocation unit\r\n");
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// cd
// ---------------------------------------------------------------------------
EFI_STATUS CommandCd(const ShellArgs &Args) {
  if (Args.Operands.empty()) {
    const std::u16string &Current = ShellCurrentMapping();
    ShellOut(Current.empty() ? u"No current directory\r\n"
                             : Current + u":" + ShellCurrentDirOf(Current) + u"\r\n");
    return EFI_SUCCESS;
  }
  const std::u16string &Target = Args.Operands[0];
  if (Target.back() == u':' && Target.find(u':') == Target.size() - 1) {
    // "fs0:" selects the volume and keeps the directory last used on it.
    if (EFI_ERROR(ShellSetCurrent(Target, nullptr))) {
      return Fail(u"cd: Cannot find mapping '" + Target + u"'", EFI_NOT_FOUND);
    }
    return EFI_SUCCESS;
  }
  std::u16string Mapping, Path;
  std::vector<UINT8> Info;
  if (EFI_ERROR(ShellQualify(Target, &Mapping, &Path)) ||
      EFI_ERROR(Probe(Mapping + u":" + Path, kRead, &Info))) {
    return Fail(u"cd: Cannot find '" + Target + u"'", EFI_NOT_FOUND);
  }
  if (!IsDirectory(Info)) {
    return Fail(u"cd: '" + Target + u"' is not a directory", EFI_INVALID_PARAMETER);
  }
  return ShellSetCurrent(Mapping, &Path);
}

// ---------------------------------------------------------------------------
// ls
// ---------------------------------------------------------------------------
// The next entry of a directory; *End once the listing is exhausted.
EFI_STATUS ReadEntry(EFI_FILE_PROTOCOL *Directory, std::vector<UINT8> *Info, bool *End) {
  UINTN Size = 0;
  EFI_STATUS Status = ShellSizedCall(
      [&](UINTN *Wanted, void *Buffer) { return Directory->Read(Directory, Wanted, Buffer); }, Info,
      &Size);
  *End = !EFI_ERROR(Status) && Size == 0;
  if (!EFI_ERROR(Status) && !*End && !ShellValidFileInfo(*Info, Size)) {
    return EFI_DEVICE_ERROR;
  }
  return Status;
}

void PrintEntry(const std::vector<UINT8> &Info) {
  std::u16string Size = IsDirectory(Info) ? u"<DIR>" : HostDecimal(ShellFileInfo(Info)->FileSize);
  ShellOut(std::u16string(Size.size() < 14 ? 14 - Size.size() : 0, u' ') + Size + u"  " +
           InfoName(Info) + u"\r\n");
}

EFI_STATUS CommandLs(const ShellArgs &Args) {
  std::u16string Mapping, Path;
  std::vector<UINT8> Info;
  EFI_FILE_PROTOCOL *File = nullptr;
  std::u16string Wanted = Args.Operands.empty() ? u"" : Args.Operands[0];
  if (EFI_ERROR(ShellQualify(Wanted, &Mapping, &Path)) ||
      EFI_ERROR(Probe(Mapping + u":" + Path, kRead, &Info, &File))) {
    return Fail(u"ls: Cannot find '" + Wanted + u"'", EFI_NOT_FOUND);
  }
  ShellOut(u"Directory of: " + Mapping + u":" + Path + u"\r\n");
  UINTN Files = 0;
  UINTN Directories = 0;
  EFI_STATUS Status = EFI_SUCCESS;
  if (!IsDirectory(Info)) {
    PrintEntry(Info);
    Files = 1;
  } else {
    for (bool End = false; !EFI_ERROR(Status);) {
      Status = ReadEntry(File, &Info, &End);
      if (EFI_ERROR(Status) || End) {
        break;
      }
      PrintEntry(Info);
      (IsDirectory(Info) ? Directories : Files)++;
    }
  }
  File->Close(File);
  ShellOut(HostDecimal(Files) + u" File(s), " + HostDecimal(Directories) + u" Dir(s)\r\n");
  return Status;
}

// ---------------------------------------------------------------------------
// cp
// ---------------------------------------------------------------------------
// Opens the destination for writing, creating the directory it goes into when
// that one level is missing.
EFI_STATUS CreateDestination(const std::u16string &Mapping, const std::u16string &Path,
                             EFI_FILE_PROTOCOL **File) {
  std::u16string Full = Mapping + u":" + Path;
  EFI_STATUS Status = ShellOpen(Full, kCreate, 0, File);
  size_t Cut = Path.rfind(u'\\');
  if (Status != EFI_NOT_FOUND || Cut == 0 || Cut == std::u16string::npos) {
    return Status;
  }
  EFI_FILE_PROTOCOL *Parent = nullptr;
  if (EFI_ERROR(
          ShellOpen(Mapping + u":" + Path.substr(0, Cut), kCreate, EFI_FILE_DIRECTORY, &Parent))) {
    return Status;
  }
  Parent->Close(Parent);
  return ShellOpen(Full, kCreate, 0, File);
}

EFI_STATUS WriteAll(EFI_FILE_PROTOCOL *File, const UINT8 *Data, UINTN Size) {
  UINTN Done = 0;
  while (Done < Size) {
    UINTN Chunk = Size - Done;
    EFI_STATUS Status = File->Write(File, &Chunk, const_cast<UINT8 *>(Data + Done));
    if (EFI_ERROR(Status)) {
      return Status;
    }
    if (Chunk == 0 || Chunk > Size - Done) {
      return EFI_DEVICE_ERROR;
    }
    Done += Chunk;
  }
  return EFI_SUCCESS;
}

// Reads the source in blocks until a read returns nothing, writing each block.
EFI_STATUS CopyData(EFI_FILE_PROTOCOL *Source, EFI_FILE_PROTOCOL *Destination,
                    const std::u16string &SourceName, const std::u16string &DestinationName) {
  std::vector<UINT8> Buffer(kCopyChunk);
  while (true) {
    UINTN Size = Buffer.size();
    EFI_STATUS Status = Source->Read(Source, &Size, Buffer.data());
    if (!EFI_ERROR(Status) && Size > Buffer.size()) {
      Status = EFI_DEVICE_ERROR; // more than was asked for
    }
    if (EFI_ERROR(Status)) {
      return Fail(u"cp: Read error on '" + SourceName + u"'", Status);
    }
    if (Size == 0) {
      return EFI_SUCCESS;
    }
    Status = WriteAll(Destination, Buffer.data(), Size);
    if (EFI_ERROR(Status)) {
      return Fail(u"cp: Write error on '" + DestinationName + u"'", Status);
    }
  }
}

// The source of a copy, open for reading: a file, not a directory.
EFI_STATUS OpenSource(const std::u16string &Operand, EFI_FILE_PROTOCOL **Source,
                      std::u16string *FullName, std::u16string *FileName) {
  std::u16string Mapping, Path;
  std::vector<UINT8> Info;
  if (EFI_ERROR(ShellQualify(Operand, &Mapping, &Path))) {
    return Fail(u"cp: Cannot find '" + Operand + u"'", EFI_NOT_FOUND);
  }
  *FullName = Mapping + u":" + Path;
  EFI_STATUS Status = Probe(*FullName, kRead, &Info, Source);
  if (EFI_ERROR(Status)) {
    return Fail(u"cp: Cannot open '" + Operand + u"'", Status);
  }
  if (IsDirectory(Info)) {
    (*Source)->Close(*Source);
    return Fail(u"cp: Copying a directory is not supported - '" + Operand + u"'", EFI_UNSUPPORTED);
  }
  *FileName = InfoName(Info);
  return EFI_SUCCESS;
}

// Where a copy goes: the file the destination names or, when it is a
// directory or ends in '\' or ':', the source's name inside it.
EFI_STATUS ResolveDestination(const std::u16string &Operand, const std::u16string &FileName,
                              std::u16string *Mapping, std::u16string *Path, bool *Exists) {
  std::u16string Target = Operand;
  std::replace(Target.begin(), Target.end(), u'/', u'\\');
  if (EFI_ERROR(ShellQualify(Target, Mapping, Path))) {
    return Fail(u"cp: Cannot find '" + Operand + u"'", EFI_NOT_FOUND);
  }
  bool IntoDirectory = Target.back() == u'\\' || Target.back() == u':';
  std::vector<UINT8> Info;
  *Exists = !EFI_ERROR(Probe(*Mapping + u":" + *Path, kRead, &Info));
  if (IntoDirectory || (*Exists && IsDirectory(Info))) {
    *Path = (*Path == u"\\" ? u"" : *Path) + u"\\" + FileName;
    *Exists = !EFI_ERROR(Probe(*Mapping + u":" + *Path, kRead, &Info));
  }
  if (*Exists && IsDirectory(Info)) {
    return Fail(u"cp: '" + *Mapping + u":" + *Path + u"' is a directory", EFI_ACCESS_DENIED);
  }
  return EFI_SUCCESS;
}

// cp [-q] [-r] SOURCE DESTINATION, one file at a time. An existing
// destination file is deleted and created anew. Without -q there is nobody to
// ask about overwriting, so every overwrite is allowed.
EFI_STATUS CommandCp(const ShellArgs &Args) {
  EFI_FILE_PROTOCOL *Source = nullptr;
  std::u16string SourceName, FileName, Mapping, Path;
  bool Exists = false;
  EFI_STATUS Status = OpenSource(Args.Operands[0], &Source, &SourceName, &FileName);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = ResolveDestination(Args.Operands[1], FileName, &Mapping, &Path, &Exists);
  std::u16string DestinationName = Mapping + u":" + Path;
  if (EFI_ERROR(Status) || HostNameEqual(DestinationName, SourceName)) {
    Source->Close(Source); // a file copied onto itself is already there
    return Status;
  }
  EFI_FILE_PROTOCOL *Destination = nullptr;
  if (Exists && !EFI_ERROR(ShellOpen(DestinationName, kReadWrite, 0, &Destination))) {
    Destination->Delete(Destination);
  }
  Status = CreateDestination(Mapping, Path, &Destination);
  if (EFI_ERROR(Status)) {
    Source->Close(Source);
    return Fail(u"cp: Cannot create '" + DestinationName + u"'", Status);
  }
  bool Quiet = Args.Has(u'q');
  if (!Quiet) {
    ShellOut(u"Copying " + SourceName + u" -> " + DestinationName + u"\r\n");
  }
  Status = CopyData(Source, Destination, SourceName, DestinationName);
  Destination->Close(Destination);
  Source->Close(Source);
  if (!EFI_ERROR(Status) && !Quiet) {
    ShellOut(u"- [ok]\r\n");
  }
  return Status;
}

// ---------------------------------------------------------------------------
// del
// ---------------------------------------------------------------------------
EFI_STATUS DeleteOne(const std::u16string &Operand, bool Quiet) {
  std::u16string Mapping, Path;
  if (EFI_ERROR(ShellQualify(Operand, &Mapping, &Path))) {
    return Fail(u"del: Cannot find '" + Operand + u"'", EFI_NOT_FOUND);
  }
  if (Path == u"\\") {
    return Fail(u"del: Cannot delete the root of " + Mapping + u":", EFI_ACCESS_DENIED);
  }
  EFI_FILE_PROTOCOL *File = nullptr;
  EFI_STATUS Status = ShellOpen(Mapping + u":" + Path, kReadWrite, 0, &File);
  if (EFI_ERROR(Status)) {
    return Fail(u"del: Cannot find '" + Operand + u"'", Status);
  }
  if (File->Delete(File) != EFI_SUCCESS) {
    return Fail(u"del: Cannot delete '" + Operand + u"'", EFI_ACCESS_DENIED);
  }
  if (!Quiet) {
    ShellOut(u"Deleting '" + Mapping + u":" + Path + u"' - [ok]\r\n");
  }
  return EFI_SUCCESS;
}

// del [-q] PATH...: every path is tried; the last failure is the result.
EFI_STATUS CommandDel(const ShellArgs &Args) {
  EFI_STATUS Result = EFI_SUCCESS;
  for (const std::u16string &Operand : Args.Operands) {
    EFI_STATUS Status = DeleteOne(Operand, Args.Has(u'q'));
    Result = EFI_ERROR(Status) ? Status : Result;
  }
  return Result;
}

constexpr UINTN kAny = ~UINTN(0);
constexpr ShellCommand kCommands[] = {
    {u"cd", u"", 0, 1, CommandCd},      {u"cp", u"qr", 2, 2, CommandCp},
    {u"copy", u"qr", 2, 2, CommandCp},  {u"del", u"q", 1, kAny, CommandDel},
    {u"rm", u"q", 1, kAny, CommandDel}, {u"ls", u"", 0, 1, CommandLs},
    {u"dir", u"", 0, 1, CommandLs},     {u"map", u"rudv", 0, 2, CommandMap},
    {u"vol", u"", 0, 1, CommandVol},    {u"echo", nullptr, 0, kAny, CommandEcho},
};

char16_t Lower(char16_t C) {
  return (C >= u'A' && C <= u'Z') ? char16_t(C - u'A' + u'a') : C;
}

} // namespace

const ShellCommand *ShellFindCommand(const std::u16string &Name) {
  for (const ShellCommand &Command : kCommands) {
    if (HostNameEqual(Name, std::u16string(Command.Name))) {
      return &Command;
    }
  }
  return nullptr;
}

EFI_STATUS ShellRunCommand(const ShellCommand &Command, const std::vector<std::u16string> &Args) {
  ShellArgs Parsed;
  Parsed.Name = Args[0];
  for (size_t I = 1; I < Args.size(); I++) {
    const std::u16string &Arg = Args[I];
    if (Command.Flags == nullptr || Arg.size() < 2 || Arg[0] != u'-') {
      Parsed.Operands.push_back(Arg);
      continue;
    }
    for (size_t J = 1; J < Arg.size(); J++) {
      if (std::u16string(Command.Flags).find(Lower(Arg[J])) == std::u16string::npos) {
        return Fail(Parsed.Name + u": Unknown flag '" + Arg + u"'", EFI_INVALID_PARAMETER);
      }
      Parsed.Flags.push_back(Lower(Arg[J]));
    }
  }
  if (Parsed.Operands.size() < Command.MinOperands) {
    return Fail(Parsed.Name + u": Too few arguments", EFI_INVALID_PARAMETER);
  }
  if (Parsed.Operands.size() > Command.MaxOperands) {
    return Fail(Parsed.Name + u": Too many arguments", EFI_INVALID_PARAMETER);
  }
  return Command.Run(Parsed);
}
