// The hosted shell: EFI_SHELL_PROTOCOL on a handle of its own and Execute,
// which runs one line of the mini shell with its output redirections. The
// commands are in HostShellCommands.cpp, the mapping table and path
// resolution in HostShellPaths.cpp.
//
// Everything here goes through the public UEFI tables only, exactly as a
// firmware shell does.
#include "HostShellInternal.h"

#include <algorithm>
#include <cstring>
#include <memory>
#include <utility>

namespace {

constexpr UINT64 kEndOfFile = 0xFFFFFFFFFFFFFFFFULL;

// Console output captured for a redirected command.
struct CaptureOut {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL Protocol; // first: the interface is the record
  SIMPLE_TEXT_OUTPUT_MODE Mode;
  std::u16string Text;
};

struct ShellState {
  EFI_SYSTEM_TABLE *SystemTable = nullptr;
  EFI_HANDLE Handle = nullptr;
  EFI_SHELL_PROTOCOL Protocol = {};
  std::vector<std::pair<std::u16string, std::u16string>> Environment;
  std::u16string EnvironmentList;
  // Strings handed to callers that the shell keeps owning (as a firmware
  // shell does until it exits); they are not pool memory, so a caller that
  // mistakenly frees one gets EFI_INVALID_PARAMETER instead of a double free.
  std::vector<std::unique_ptr<CHAR16[]>> Handed;
  bool PageBreak = false;
};

ShellState *gShell = nullptr;

EFI_BOOT_SERVICES *BootServices() {
  return gShell->SystemTable->BootServices;
}

const CHAR16 *Hand(const std::u16string &Text) {
  std::unique_ptr<CHAR16[]> Copy(new CHAR16[Text.size() + 1]);
  std::memcpy(Copy.get(), Text.c_str(), (Text.size() + 1) * sizeof(CHAR16));
  gShell->Handed.push_back(std::move(Copy));
  return gShell->Handed.back().get();
}

void SetEnvironment(const std::u16string &Name, const std::u16string &Value) {
  auto &Env = gShell->Environment;
  auto It = std::find_if(Env.begin(), Env.end(),
                         [&](const auto &Entry) { return HostNameEqual(Entry.first, Name); });
  if (Value.empty()) {
    if (It != Env.end()) {
      Env.erase(It);
    }
  } else if (It != Env.end()) {
    It->second = Value;
  } else {
    Env.push_back({Name, Value});
  }
}

// The current directory as "MAP:\path", empty when there is none.
std::u16string CurrentDirectory() {
  const std::u16string &Mapping = ShellCurrentMapping();
  return Mapping.empty() ? std::u16string() : Mapping + u":" + ShellCurrentDirOf(Mapping);
}

// ---------------------------------------------------------------------------
// Command lines
// ---------------------------------------------------------------------------
struct Token {
  std::u16string Text;
  bool Quoted;
};

// Splits at blanks; double quotes group (and are removed), '^' takes the next
// character literally, an unquoted '#' starts a comment.
EFI_STATUS Tokenize(const CHAR16 *Line, std::vector<Token> *Tokens) {
  const CHAR16 *P = Line;
  while (true) {
    while (*P == u' ' || *P == u'\t') {
      P++;
    }
    if (*P == 0 || *P == u'#') {
      return EFI_SUCCESS;
    }
    Token Current = {u"", false};
    bool InQuotes = false;
    for (; *P != 0; P++) {
      if (*P == u'^' && P[1] != 0) {
        Current.Text.push_back(*++P);
      } else if (*P == u'"') {
        InQuotes = !InQuotes;
        Current.Quoted = true;
      } else if (!InQuotes && (*P == u' ' || *P == u'\t' || *P == u'#')) {
        break;
      } else {
        Current.Text.push_back(*P);
      }
    }
    if (InQuotes) {
      return EFI_INVALID_PARAMETER;
    }
    Tokens->push_back(Current);
  }
}

struct Redirect {
  int Stream; // 1 standard output, 2 standard error
  bool Append;
  bool Ascii;
  std::u16string Target;
  EFI_FILE_PROTOCOL *File;
  bool Bom;
  CaptureOut Capture;
};

// ">", ">>", ">a", ">>a", optionally preceded by the stream number 1 or 2.
bool ParseRedirect(const std::u16string &Op, Redirect *R) {
  size_t I = 0;
  R->Stream = 1;
  if (!Op.empty() && (Op[0] == u'1' || Op[0] == u'2')) {
    R->Stream = Op[0] - u'0';
    I = 1;
  }
  if (I >= Op.size() || Op[I] != u'>') {
    return false;
  }
  I++;
  R->Append = I < Op.size() && Op[I] == u'>';
  I += R->Append ? 1 : 0;
  R->Ascii = I < Op.size() && (Op[I] == u'a' || Op[I] == u'A');
  I += R->Ascii ? 1 : 0;
  return I == Op.size();
}

EFI_STATUS EFIAPI CaptureOutputString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String) {
  if (String != nullptr) {
    reinterpret_cast<CaptureOut *>(This)->Text += String;
  }
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureReset(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, BOOLEAN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureTestString(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, const CHAR16 *) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureQueryMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN Mode, UINTN *Columns,
                                   UINTN *Rows) {
  if (Mode != 0 || Columns == nullptr || Rows == nullptr) {
    return EFI_UNSUPPORTED;
  }
  *Columns = 80;
  *Rows = 25;
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureSetMode(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN Mode) {
  return Mode == 0 ? EFI_SUCCESS : EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI CaptureUintn(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureClear(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureCursor(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, UINTN, UINTN) {
  return EFI_SUCCESS;
}
EFI_STATUS EFIAPI CaptureEnable(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *, BOOLEAN) {
  return EFI_SUCCESS;
}

void InitCapture(CaptureOut *Capture) {
  Capture->Mode = {1, 0, 0x07, 0, 0, FALSE};
  Capture->Protocol = {CaptureReset,   CaptureOutputString, CaptureTestString, CaptureQueryMode,
                       CaptureSetMode, CaptureUintn,        CaptureClear,      CaptureCursor,
                       CaptureEnable,  &Capture->Mode};
}

void SystemTableChanged() {
  EFI_SYSTEM_TABLE *St = gShell->SystemTable;
  St->Hdr.CRC32 = 0;
  UINT32 Crc = 0;
  if (!EFI_ERROR(BootServices()->CalculateCrc32(St, St->Hdr.HeaderSize, &Crc))) {
    St->Hdr.CRC32 = Crc;
  }
}

EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL **StreamSlot(int Stream) {
  return Stream == 2 ? &gShell->SystemTable->StdErr : &gShell->SystemTable->ConOut;
}

// ">" starts the file afresh, ">>" appends; UCS-2 files begin with a BOM.
EFI_STATUS OpenRedirect(Redirect *R) {
  if (!R->Append) {
    EFI_FILE_PROTOCOL *Old = nullptr;
    if (!EFI_ERROR(ShellOpen(R->Target, EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE, 0, &Old))) {
      Old->Delete(Old);
    }
  }
  EFI_STATUS Status = ShellOpen(
      R->Target, EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE | EFI_FILE_MODE_CREATE, 0, &R->File);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  std::vector<UINT8> Info;
  Status = ShellGetInfo(R->File, gEfiFileInfoGuid, &Info);
  if (!EFI_ERROR(Status) && (ShellFileInfo(Info)->Attribute & EFI_FILE_DIRECTORY) != 0) {
    Status = EFI_INVALID_PARAMETER;
  }
  if (!EFI_ERROR(Status) && R->Append) {
    Status = R->File->SetPosition(R->File, kEndOfFile);
  }
  if (EFI_ERROR(Status)) {
    R->File->Close(R->File);
    R->File = nullptr;
    return Status;
  }
  R->Bom = !R->Ascii && ShellFileInfo(Info)->FileSize == 0;
  return EFI_SUCCESS;
}

void FinishRedirect(Redirect *R) {
  std::vector<UINT8> Bytes;
  if (R->Bom) {
    Bytes = {0xFF, 0xFE};
  }
  for (char16_t C : R->Capture.Text) {
    if (R->Ascii) {
      Bytes.push_back(C < 0x100 ? static_cast<UINT8>(C) : '?');
    } else {
      Bytes.push_back(static_cast<UINT8>(C & 0xFF));
      Bytes.push_back(static_cast<UINT8>(C >> 8));
    }
  }
  UINTN Done = 0;
  while (Done < Bytes.size()) {
    UINTN Size = Bytes.size() - Done;
    if (EFI_ERROR(R->File->Write(R->File, &Size, Bytes.data() + Done)) || Size == 0) {
      ShellOut(u"Unable to write the redirected output to '" + R->Target + u"'.\r\n");
      break;
    }
    Done += Size;
  }
  R->File->Close(R->File);
}

// Runs one command line; returns the launch status, the command's own status
// in *CommandStatus.
EFI_STATUS RunLine(const CHAR16 *Line, EFI_STATUS *CommandStatus) {
  *CommandStatus = EFI_SUCCESS;
  std::vector<Token> Tokens;
  if (EFI_ERROR(Tokenize(Line, &Tokens))) {
    ShellOut(u"Unbalanced quotes in the command line.\r\n");
    return EFI_INVALID_PARAMETER;
  }
  std::vector<std::u16string> Args;
  std::vector<std::unique_ptr<Redirect>> Redirects;
  for (size_t I = 0; I < Tokens.size(); I++) {
    std::unique_ptr<Redirect> R(new Redirect());
    if (Tokens[I].Quoted || !ParseRedirect(Tokens[I].Text, R.get())) {
      Args.push_back(Tokens[I].Text);
      continue;
    }
    bool Twice = std::any_of(Redirects.begin(), Redirects.end(),
                             [&](const auto &Other) { return Other->Stream == R->Stream; });
    if (I + 1 == Tokens.size() || Twice) {
      ShellOut(u"Invalid redirection in the command line.\r\n");
      return EFI_INVALID_PARAMETER;
    }
    R->Target = Tokens[++I].Text;
    Redirects.push_back(std::move(R));
  }
  if (Args.empty()) {
    return Redirects.empty() ? EFI_SUCCESS : EFI_INVALID_PARAMETER;
  }
  const ShellCommand *Command = ShellFindCommand(Args[0]);
  if (Command == nullptr && Args.size() == 1 && Args[0].size() > 1 && Args[0].back() == u':') {
    Command = ShellFindCommand(u"cd"); // "fs0:" alone changes the current volume
    Args.insert(Args.begin(), u"cd");
  }
  if (Command == nullptr) {
    ShellOut(u"'" + Args[0] +
             u"' is not recognized as an internal or external command, operable program, or "
             u"script file.\r\n");
    return EFI_NOT_FOUND;
  }
  for (size_t I = 0; I < Redirects.size(); I++) {
    EFI_STATUS Status = OpenRedirect(Redirects[I].get());
    if (EFI_ERROR(Status)) {
      ShellOut(u"Unable to redirect output to '" + Redirects[I]->Target + u"'.\r\n");
      for (size_t J = 0; J < I; J++) {
        Redirects[J]->File->Close(Redirects[J]->File);
      }
      return Status;
    }
  }
  std::vector<EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *> Saved;
  for (auto &R : Redirects) {
    InitCapture(&R->Capture);
    Saved.push_back(*StreamSlot(R->Stream));
    *StreamSlot(R->Stream) = &R->Capture.Protocol;
  }
  if (!Redirects.empty()) {
    SystemTableChanged();
  }
  *CommandStatus = ShellRunCommand(*Command, Args);
  for (size_t I = 0; I < Redirects.size(); I++) {
    *StreamSlot(Redirects[I]->Stream) = Saved[I];
  }
  if (!Redirects.empty()) {
    SystemTableChanged();
  }
  for (auto &R : Redirects) {
    FinishRedirect(R.get());
  }
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// EFI_SHELL_PROTOCOL
// ---------------------------------------------------------------------------
EFI_STATUS EFIAPI ShellExecute(EFI_HANDLE *ParentImageHandle, CHAR16 *CommandLine, CHAR16 **,
                               EFI_STATUS *StatusCode) {
  if (ParentImageHandle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (CommandLine == nullptr) {
    return EFI_UNSUPPORTED; // an interactive nested shell is not offered
  }
  EFI_STATUS CommandStatus = EFI_SUCCESS;
  EFI_STATUS Status = RunLine(CommandLine, &CommandStatus);
  EFI_STATUS Result = EFI_ERROR(Status) ? Status : CommandStatus;
  if (StatusCode != nullptr) {
    *StatusCode = Result;
  }
  SetEnvironment(u"lasterror", HostHex(Result & ~EFI_ERROR_BIT));
  return Status;
}

const CHAR16 *EFIAPI ShellGetEnv(const CHAR16 *Name) {
  if (Name == nullptr) {
    std::u16string &List = gShell->EnvironmentList;
    List.clear();
    for (const auto &Entry : gShell->Environment) {
      List += Entry.first;
      List.push_back(0);
    }
    List.push_back(0);
    return List.c_str();
  }
  if (HostNameEqual(std::u16string(Name), u"cwd")) {
    std::u16string Cwd = CurrentDirectory();
    return Cwd.empty() ? nullptr : Hand(Cwd);
  }
  for (const auto &Entry : gShell->Environment) {
    if (HostNameEqual(Entry.first, Name)) {
      return Entry.second.c_str();
    }
  }
  return nullptr;
}

EFI_STATUS EFIAPI ShellSetEnv(const CHAR16 *Name, const CHAR16 *Value, BOOLEAN) {
  if (Name == nullptr || Value == nullptr || *Name == 0) {
    return EFI_INVALID_PARAMETER;
  }
  SetEnvironment(Name, Value);
  return EFI_SUCCESS;
}

const EFI_DEVICE_PATH_PROTOCOL *EFIAPI ShellGetDevicePathFromMap(const CHAR16 *Mapping) {
  const ShellMapping *Found = Mapping != nullptr ? ShellMapFind(Mapping) : nullptr;
  return Found != nullptr
             ? reinterpret_cast<const EFI_DEVICE_PATH_PROTOCOL *>(Found->DevicePath.data())
             : nullptr;
}

// Every name of the volume, each with its ':', separated by ';'. On a match
// *DevicePath is moved to its end node, as the firmware shell does.
const CHAR16 *EFIAPI ShellGetMapFromDevicePath(EFI_DEVICE_PATH_PROTOCOL **DevicePath) {
  if (DevicePath == nullptr || *DevicePath == nullptr) {
    return nullptr;
  }
  std::vector<UINT8> Wanted = ShellDevicePathBytes(*DevicePath);
  if (Wanted.empty()) {
    return nullptr;
  }
  std::u16string Names;
  for (const ShellMapping &Mapping : ShellMappings()) {
    if (Mapping.DevicePath == Wanted) {
      Names += (Names.empty() ? u"" : u";") + Mapping.Name + u":";
    }
  }
  if (Names.empty()) {
    return nullptr;
  }
  *DevicePath = reinterpret_cast<EFI_DEVICE_PATH_PROTOCOL *>(
      reinterpret_cast<UINT8 *>(*DevicePath) + Wanted.size() - sizeof(EFI_DEVICE_PATH_PROTOCOL));
  return Hand(Names);
}

EFI_STATUS EFIAPI ShellSetMap(const EFI_DEVICE_PATH_PROTOCOL *DevicePath, const CHAR16 *Mapping) {
  if (Mapping == nullptr || *Mapping == 0 || Mapping[std::u16string(Mapping).size() - 1] != u':') {
    return EFI_INVALID_PARAMETER;
  }
  std::u16string Name(Mapping);
  Name.pop_back();
  if (DevicePath == nullptr) {
    return ShellMapDelete(Name);
  }
  std::vector<UINT8> Bytes = ShellDevicePathBytes(DevicePath);
  std::vector<ShellVolume> Present = ShellPresentVolumes();
  if (Bytes.empty() || std::none_of(Present.begin(), Present.end(),
                                    [&](const ShellVolume &V) { return V.DevicePath == Bytes; })) {
    return EFI_NO_MAPPING;
  }
  return ShellMapAdd(Name, Bytes);
}

const CHAR16 *EFIAPI ShellGetCurDir(const CHAR16 *FileSystemMapping) {
  if (FileSystemMapping == nullptr) {
    std::u16string Cwd = CurrentDirectory();
    return Cwd.empty() ? nullptr : Hand(Cwd);
  }
  const ShellMapping *Mapping = ShellMapFind(FileSystemMapping);
  return Mapping != nullptr ? Hand(Mapping->Name + u":" + ShellCurrentDirOf(Mapping->Name))
                            : nullptr;
}

EFI_STATUS EFIAPI ShellSetCurDir(const CHAR16 *FileSystem, const CHAR16 *Dir) {
  if (FileSystem == nullptr && Dir == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::u16string Mapping, Path;
  if (FileSystem == nullptr) {
    EFI_STATUS Status = ShellQualify(Dir, &Mapping, &Path);
    return EFI_ERROR(Status) ? Status : ShellSetCurrent(Mapping, &Path);
  }
  const ShellMapping *Found = ShellMapFind(FileSystem);
  if (Found == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (Dir == nullptr) {
    return ShellSetCurrent(Found->Name, nullptr);
  }
  std::u16string Text = std::u16string(Dir);
  std::replace(Text.begin(), Text.end(), u'/', u'\\');
  bool Absolute = !Text.empty() && Text[0] == u'\\';
  ShellSetDirectoryOf(
      Found->Name,
      ShellCleanPath((Absolute ? u"" : ShellCurrentDirOf(Found->Name)) + u"\\" + Text));
  return EFI_SUCCESS;
}

BOOLEAN EFIAPI ShellBatchIsActive() {
  return FALSE;
}
BOOLEAN EFIAPI ShellIsRootShell() {
  return TRUE;
}
void EFIAPI ShellEnablePageBreak() {
  gShell->PageBreak = true;
}
void EFIAPI ShellDisablePageBreak() {
  gShell->PageBreak = false;
}
BOOLEAN EFIAPI ShellGetPageBreak() {
  return gShell->PageBreak ? TRUE : FALSE;
}

EFI_FILE_PROTOCOL *AsFile(SHELL_FILE_HANDLE Handle) {
  return static_cast<EFI_FILE_PROTOCOL *>(Handle);
}

EFI_FILE_INFO *EFIAPI ShellGetFileInfo(SHELL_FILE_HANDLE FileHandle) {
  std::vector<UINT8> Info;
  if (FileHandle == nullptr ||
      EFI_ERROR(ShellGetInfo(AsFile(FileHandle), gEfiFileInfoGuid, &Info))) {
    return nullptr;
  }
  void *Copy = nullptr; // the caller frees it with FreePool
  if (EFI_ERROR(BootServices()->AllocatePool(EfiBootServicesData, Info.size(), &Copy))) {
    return nullptr;
  }
  std::memcpy(Copy, Info.data(), Info.size());
  return static_cast<EFI_FILE_INFO *>(Copy);
}

EFI_STATUS EFIAPI ShellSetFileInfo(SHELL_FILE_HANDLE FileHandle, const EFI_FILE_INFO *FileInfo) {
  if (FileHandle == nullptr || FileInfo == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  return AsFile(FileHandle)
      ->SetInfo(AsFile(FileHandle), &gEfiFileInfoGuid, static_cast<UINTN>(FileInfo->Size),
                const_cast<EFI_FILE_INFO *>(FileInfo));
}

EFI_STATUS EFIAPI ShellOpenFileByName(const CHAR16 *FileName, SHELL_FILE_HANDLE *FileHandle,
                                      UINT64 OpenMode) {
  if (FileName == nullptr || FileHandle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_FILE_PROTOCOL *File = nullptr;
  EFI_STATUS Status = ShellOpen(FileName, OpenMode, 0, &File);
  *FileHandle = File;
  return Status;
}

EFI_STATUS EFIAPI ShellCloseFile(SHELL_FILE_HANDLE FileHandle) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->Close(AsFile(FileHandle));
}

EFI_STATUS EFIAPI ShellCreateFile(const CHAR16 *FileName, UINT64 FileAttribs,
                                  SHELL_FILE_HANDLE *FileHandle) {
  if (FileName == nullptr || FileHandle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_FILE_PROTOCOL *File = nullptr;
  EFI_STATUS Status =
      ShellOpen(FileName, EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE | EFI_FILE_MODE_CREATE,
                FileAttribs, &File);
  *FileHandle = File;
  return Status;
}

EFI_STATUS EFIAPI ShellReadFile(SHELL_FILE_HANDLE FileHandle, UINTN *ReadSize, void *Buffer) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->Read(AsFile(FileHandle), ReadSize, Buffer);
}

EFI_STATUS EFIAPI ShellWriteFile(SHELL_FILE_HANDLE FileHandle, UINTN *BufferSize, void *Buffer) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->Write(AsFile(FileHandle), BufferSize, Buffer);
}

EFI_STATUS EFIAPI ShellDeleteFile(SHELL_FILE_HANDLE FileHandle) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->Delete(AsFile(FileHandle));
}

EFI_STATUS EFIAPI ShellDeleteFileByName(const CHAR16 *FileName) {
  SHELL_FILE_HANDLE Handle = nullptr;
  EFI_STATUS Status =
      ShellOpenFileByName(FileName, &Handle, EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE);
  return EFI_ERROR(Status) ? Status : ShellDeleteFile(Handle);
}

EFI_STATUS EFIAPI ShellGetFilePosition(SHELL_FILE_HANDLE FileHandle, UINT64 *Position) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->GetPosition(AsFile(FileHandle), Position);
}

EFI_STATUS EFIAPI ShellSetFilePosition(SHELL_FILE_HANDLE FileHandle, UINT64 Position) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->SetPosition(AsFile(FileHandle), Position);
}

EFI_STATUS EFIAPI ShellFlushFile(SHELL_FILE_HANDLE FileHandle) {
  return FileHandle == nullptr ? EFI_INVALID_PARAMETER
                               : AsFile(FileHandle)->Flush(AsFile(FileHandle));
}

EFI_STATUS EFIAPI ShellGetFileSize(SHELL_FILE_HANDLE FileHandle, UINT64 *Size) {
  if (FileHandle == nullptr || Size == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<UINT8> Info;
  EFI_STATUS Status = ShellGetInfo(AsFile(FileHandle), gEfiFileInfoGuid, &Info);
  if (!EFI_ERROR(Status)) {
    *Size = ShellFileInfo(Info)->FileSize;
  }
  return Status;
}

EFI_STATUS OpenVolumeOn(EFI_HANDLE Handle, SHELL_FILE_HANDLE *FileHandle) {
  EFI_FILE_PROTOCOL *Root = nullptr;
  EFI_STATUS Status = ShellOpenVolume(Handle, &Root);
  *FileHandle = Root;
  return Status;
}

EFI_STATUS EFIAPI ShellOpenRoot(EFI_DEVICE_PATH_PROTOCOL *DevicePath,
                                SHELL_FILE_HANDLE *FileHandle) {
  if (DevicePath == nullptr || FileHandle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<UINT8> Wanted = ShellDevicePathBytes(DevicePath);
  for (const ShellVolume &V : ShellPresentVolumes()) {
    if (!Wanted.empty() && V.DevicePath == Wanted) {
      return OpenVolumeOn(V.Handle, FileHandle);
    }
  }
  return EFI_NOT_FOUND;
}

EFI_STATUS EFIAPI ShellOpenRootByHandle(EFI_HANDLE DeviceHandle, SHELL_FILE_HANDLE *FileHandle) {
  if (DeviceHandle == nullptr || FileHandle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  return OpenVolumeOn(DeviceHandle, FileHandle);
}

// The operations this shell does not offer.
const CHAR16 *EFIAPI ShellGetAlias(const CHAR16 *, BOOLEAN *) {
  return nullptr;
}
EFI_STATUS EFIAPI ShellSetAlias(const CHAR16 *, const CHAR16 *, BOOLEAN, BOOLEAN) {
  return EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI ShellGetHelpText(const CHAR16 *, const CHAR16 *, CHAR16 **) {
  return EFI_UNSUPPORTED;
}
EFI_DEVICE_PATH_PROTOCOL *EFIAPI ShellGetDevicePathFromFilePath(const CHAR16 *) {
  return nullptr;
}
CHAR16 *EFIAPI ShellGetFilePathFromDevicePath(const EFI_DEVICE_PATH_PROTOCOL *) {
  return nullptr;
}
EFI_STATUS EFIAPI ShellOpenFileList(CHAR16 *, UINT64, EFI_SHELL_FILE_INFO **) {
  return EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI ShellFileListUnsupported(EFI_SHELL_FILE_INFO **) {
  return EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI ShellGetDeviceName(EFI_HANDLE, UINT32, CHAR8 *, CHAR16 **) {
  return EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI ShellFindFiles(const CHAR16 *, EFI_SHELL_FILE_INFO **) {
  return EFI_UNSUPPORTED;
}
EFI_STATUS EFIAPI ShellFindFilesInDir(SHELL_FILE_HANDLE, EFI_SHELL_FILE_INFO **) {
  return EFI_UNSUPPORTED;
}

EFI_SHELL_PROTOCOL MakeProtocol() {
  EFI_SHELL_PROTOCOL P = {};
  P.Execute = ShellExecute;
  P.GetEnv = ShellGetEnv;
  P.SetEnv = ShellSetEnv;
  P.GetAlias = ShellGetAlias;
  P.SetAlias = ShellSetAlias;
  P.GetHelpText = ShellGetHelpText;
  P.GetDevicePathFromMap = ShellGetDevicePathFromMap;
  P.GetMapFromDevicePath = ShellGetMapFromDevicePath;
  P.GetDevicePathFromFilePath = ShellGetDevicePathFromFilePath;
  P.GetFilePathFromDevicePath = ShellGetFilePathFromDevicePath;
  P.SetMap = ShellSetMap;
  P.GetCurDir = ShellGetCurDir;
  P.SetCurDir = ShellSetCurDir;
  P.OpenFileList = ShellOpenFileList;
  P.FreeFileList = ShellFileListUnsupported;
  P.RemoveDupInFileList = ShellFileListUnsupported;
  P.BatchIsActive = ShellBatchIsActive;
  P.IsRootShell = ShellIsRootShell;
  P.EnablePageBreak = ShellEnablePageBreak;
  P.DisablePageBreak = ShellDisablePageBreak;
  P.GetPageBreak = ShellGetPageBreak;
  P.GetDeviceName = ShellGetDeviceName;
  P.GetFileInfo = ShellGetFileInfo;
  P.SetFileInfo = ShellSetFileInfo;
  P.OpenFileByName = ShellOpenFileByName;
  P.CloseFile = ShellCloseFile;
  P.CreateFile = ShellCreateFile;
  P.ReadFile = ShellReadFile;
  P.WriteFile = ShellWriteFile;
  P.DeleteFile = ShellDeleteFile;
  P.DeleteFileByName = ShellDeleteFileByName;
  P.GetFilePosition = ShellGetFilePosition;
  P.SetFilePosition = ShellSetFilePosition;
  P.FlushFile = ShellFlushFile;
  P.FindFiles = ShellFindFiles;
  P.FindFilesInDir = ShellFindFilesInDir;
  P.GetFileSize = ShellGetFileSize;
  P.OpenRoot = ShellOpenRoot;
  P.OpenRootByHandle = ShellOpenRootByHandle;
  P.MajorVersion = 2;
  P.MinorVersion = 2;
  return P;
}

} // namespace

void ShellOut(const std::u16string &Text) {
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *Out = gShell->SystemTable->ConOut;
  if (Out != nullptr && Out->OutputString != nullptr) {
    Out->OutputString(Out, Text.c_str());
  }
}

void HostShellInstall(EFI_SYSTEM_TABLE *SystemTable) {
  HostShellUninstall();
  if (SystemTable == nullptr || SystemTable->BootServices == nullptr) {
    return;
  }
  gShell = new ShellState();
  gShell->SystemTable = SystemTable;
  gShell->Protocol = MakeProtocol();
  BootServices()->CreateEvent(0, TPL_APPLICATION, nullptr, nullptr,
                              &gShell->Protocol.ExecutionBreak);
  if (EFI_ERROR(BootServices()->InstallProtocolInterface(
          &gShell->Handle, &gEfiShellProtocolGuid, EFI_NATIVE_INTERFACE, &gShell->Protocol))) {
    HostShellUninstall();
    return;
  }
  ShellPathsStart(SystemTable->BootServices);
}

void HostShellUninstall() {
  if (gShell == nullptr) {
    return;
  }
  if (gShell->Handle != nullptr) {
    BootServices()->UninstallProtocolInterface(gShell->Handle, &gEfiShellProtocolGuid,
                                               &gShell->Protocol);
  }
  if (gShell->Protocol.ExecutionBreak != nullptr) {
    BootServices()->CloseEvent(gShell->Protocol.ExecutionBreak);
  }
  ShellPathsStop();
  delete gShell;
  gShell = nullptr;
}
