// The hosted shell's view of the volumes: the mapping table that gives them
// their shell names ("FS0", "ramfs", aliases added with "map"), the current
// directory of each, and the resolution of shell paths to a volume and a path
// on it. Volumes are found with LocateHandleBuffer and reached only through
// their EFI_SIMPLE_FILE_SYSTEM and EFI_FILE_PROTOCOL interfaces.
#include "HostShellInternal.h"

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <functional>
#include <utility>

namespace {

constexpr UINTN kMaxDevicePath = 4096;
constexpr UINTN kMaxInfo = 64 * 1024;

struct PathState {
  EFI_BOOT_SERVICES *BootServices = nullptr;
  std::vector<ShellMapping> Mappings;
  UINTN NextFsNumber = 0;
  std::u16string CurrentMapping;
  std::vector<std::pair<std::u16string, std::u16string>> Directories; // mapping, "\dir"
};

PathState *gPaths = nullptr;

EFI_BOOT_SERVICES *BootServices() {
  return gPaths->BootServices;
}

char16_t Fold(char16_t C) {
  return (C >= u'a' && C <= u'z') ? char16_t(C - u'a' + u'A') : C;
}

std::u16string StripColon(const std::u16string &Name) {
  return (!Name.empty() && Name.back() == u':') ? Name.substr(0, Name.size() - 1) : Name;
}

} // namespace

bool HostNameEqual(const std::u16string &A, const std::u16string &B) {
  return A.size() == B.size() &&
         std::equal(A.begin(), A.end(), B.begin(),
                    [](char16_t X, char16_t Y) { return Fold(X) == Fold(Y); });
}

bool HostNameEqual(const std::string &A, const std::string &B) {
  return A.size() == B.size() && std::equal(A.begin(), A.end(), B.begin(), [](char X, char Y) {
           return Fold(static_cast<unsigned char>(X)) == Fold(static_cast<unsigned char>(Y));
         });
}

std::u16string HostDecimal(UINT64 Value) {
  std::u16string Digits;
  do {
    Digits.insert(Digits.begin(), char16_t(u'0' + Value % 10));
    Value /= 10;
  } while (Value != 0);
  return Digits;
}

std::u16string HostHex(UINT64 Value) {
  std::u16string Digits;
  do {
    Digits.insert(Digits.begin(), u"0123456789ABCDEF"[Value & 0xF]);
    Value >>= 4;
  } while (Value != 0);
  return u"0x" + Digits;
}

UINTN HostDevicePathSize(const EFI_DEVICE_PATH_PROTOCOL *Path) {
  if (Path == nullptr) {
    return 0;
  }
  const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Path);
  UINTN Offset = 0;
  while (Offset + sizeof(EFI_DEVICE_PATH_PROTOCOL) <= kMaxDevicePath) {
    const UINT8 *Node = Bytes + Offset;
    UINTN Length = Node[2] | (Node[3] << 8);
    if (Length < sizeof(EFI_DEVICE_PATH_PROTOCOL)) {
      return 0;
    }
    Offset += Length;
    if (Node[0] == END_DEVICE_PATH_TYPE && Node[1] == END_ENTIRE_DEVICE_PATH_SUBTYPE) {
      return Offset <= kMaxDevicePath ? Offset : 0;
    }
  }
  return 0;
}

std::u16string HostDevicePathText(const EFI_DEVICE_PATH_PROTOCOL *Path) {
  UINTN Size = HostDevicePathSize(Path);
  if (Size == 0) {
    return u"(invalid device path)";
  }
  const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Path);
  std::u16string Text;
  for (UINTN Offset = 0; Offset + sizeof(EFI_DEVICE_PATH_PROTOCOL) < Size;) {
    const UINT8 *Node = Bytes + Offset;
    UINTN Length = Node[2] | (Node[3] << 8);
    if (!Text.empty()) {
      Text += u"/";
    }
    if (Node[0] == HARDWARE_DEVICE_PATH && Node[1] == HW_VENDOR_DP && Length >= 20) {
      EFI_GUID Guid;
      std::memcpy(&Guid, Node + 4, sizeof Guid);
      char Buffer[40];
      snprintf(Buffer, sizeof Buffer, "%08X-%04X-%04X-%02X%02X-%02X%02X%02X%02X%02X%02X",
               Guid.Data1, Guid.Data2, Guid.Data3, Guid.Data4[0], Guid.Data4[1], Guid.Data4[2],
               Guid.Data4[3], Guid.Data4[4], Guid.Data4[5], Guid.Data4[6], Guid.Data4[7]);
      Text += u"VenHw(" + HostUtf8ToUcs2(Buffer) + u")";
    } else {
      Text += u"Path(" + HostDecimal(Node[0]) + u"," + HostDecimal(Node[1]) + u",";
      for (UINTN I = 4; I < Length; I++) {
        Text.push_back(u"0123456789ABCDEF"[Node[I] >> 4]);
        Text.push_back(u"0123456789ABCDEF"[Node[I] & 0xF]);
      }
      Text += u")";
    }
    Offset += Length;
  }
  return Text;
}

std::vector<UINT8> ShellDevicePathBytes(const EFI_DEVICE_PATH_PROTOCOL *Path) {
  UINTN Size = HostDevicePathSize(Path);
  const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Path);
  return Size == 0 ? std::vector<UINT8>() : std::vector<UINT8>(Bytes, Bytes + Size);
}

// Handles with a file system and a device path, in the database's order.
std::vector<ShellVolume> ShellPresentVolumes() {
  std::vector<ShellVolume> Result;
  UINTN Count = 0;
  EFI_HANDLE *Buffer = nullptr;
  if (EFI_ERROR(BootServices()->LocateHandleBuffer(ByProtocol, &gEfiSimpleFileSystemProtocolGuid,
                                                   nullptr, &Count, &Buffer))) {
    return Result;
  }
  for (UINTN I = 0; I < Count; I++) {
    void *Path = nullptr;
    if (EFI_ERROR(BootServices()->HandleProtocol(Buffer[I], &gEfiDevicePathProtocolGuid, &Path)) ||
        Path == nullptr) {
      continue;
    }
    std::vector<UINT8> Bytes = ShellDevicePathBytes(static_cast<EFI_DEVICE_PATH_PROTOCOL *>(Path));
    if (!Bytes.empty()) {
      Result.push_back({Buffer[I], Bytes});
    }
  }
  BootServices()->FreePool(Buffer);
  return Result;
}

EFI_STATUS ShellOpenVolume(EFI_HANDLE Handle, EFI_FILE_PROTOCOL **Root) {
  *Root = nullptr;
  void *Interface = nullptr;
  if (EFI_ERROR(
          BootServices()->HandleProtocol(Handle, &gEfiSimpleFileSystemProtocolGuid, &Interface))) {
    return EFI_NOT_FOUND;
  }
  auto *Fs = static_cast<EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *>(Interface);
  EFI_STATUS Status = Fs->OpenVolume(Fs, Root);
  if (EFI_ERROR(Status)) {
    *Root = nullptr;
  }
  return Status;
}

// ---------------------------------------------------------------------------
// Paths
// ---------------------------------------------------------------------------
std::vector<std::u16string> HostSplitPath(const std::u16string &Path) {
  std::vector<std::u16string> Parts;
  size_t Start = 0;
  while (Start <= Path.size()) {
    size_t End = Path.find(u'\\', Start);
    End = End == std::u16string::npos ? Path.size() : End;
    if (End > Start) {
      Parts.push_back(Path.substr(Start, End - Start));
    }
    Start = End + 1;
  }
  return Parts;
}

std::u16string ShellCleanPath(const std::u16string &Path) {
  std::vector<std::u16string> Parts;
  for (const std::u16string &Part : HostSplitPath(Path)) {
    if (Part == u"..") {
      if (!Parts.empty()) {
        Parts.pop_back();
      }
    } else if (Part != u".") {
      Parts.push_back(Part);
    }
  }
  std::u16string Result;
  for (const std::u16string &Part : Parts) {
    Result += u"\\" + Part;
  }
  return Result.empty() ? u"\\" : Result;
}

void ShellSetDirectoryOf(const std::u16string &Mapping, const std::u16string &Path) {
  for (auto &Entry : gPaths->Directories) {
    if (HostNameEqual(Entry.first, Mapping)) {
      Entry.second = Path;
      return;
    }
  }
  gPaths->Directories.push_back({Mapping, Path});
}

void ShellMapRefresh(bool Reset) {
  std::vector<ShellVolume> Present = ShellPresentVolumes();
  auto IsPresent = [&](const std::vector<UINT8> &Path) {
    return std::any_of(Present.begin(), Present.end(),
                       [&](const ShellVolume &V) { return V.DevicePath == Path; });
  };
  auto &Mappings = gPaths->Mappings;
  if (Reset) {
    Mappings.clear();
    gPaths->NextFsNumber = 0;
  } else {
    Mappings.erase(std::remove_if(Mappings.begin(), Mappings.end(),
                                  [&](const ShellMapping &M) { return !IsPresent(M.DevicePath); }),
                   Mappings.end());
  }
  for (const ShellVolume &V : Present) {
    bool Mapped = std::any_of(Mappings.begin(), Mappings.end(),
                              [&](const ShellMapping &M) { return M.DevicePath == V.DevicePath; });
    if (!Mapped) {
      // Like the firmware shell, numbers keep counting up until a reset.
      Mappings.push_back({u"FS" + HostDecimal(gPaths->NextFsNumber++), V.DevicePath});
    }
    if (V.Handle == HostRamfsHandle() && ShellMapFind(u"ramfs") == nullptr) {
      Mappings.push_back({u"ramfs", V.DevicePath});
    }
  }
  if (!gPaths->CurrentMapping.empty() && ShellMapFind(gPaths->CurrentMapping) == nullptr) {
    gPaths->CurrentMapping.clear();
  }
}

const std::vector<ShellMapping> &ShellMappings() {
  return gPaths->Mappings;
}

const ShellMapping *ShellMapFind(const std::u16string &Name) {
  std::u16string Wanted = StripColon(Name);
  for (const ShellMapping &Mapping : gPaths->Mappings) {
    if (HostNameEqual(Mapping.Name, Wanted)) {
      return &Mapping;
    }
  }
  return nullptr;
}

EFI_STATUS ShellMapAdd(const std::u16string &Name, const std::vector<UINT8> &DevicePath) {
  for (ShellMapping &Mapping : gPaths->Mappings) {
    if (HostNameEqual(Mapping.Name, Name)) {
      Mapping.DevicePath = DevicePath;
      return EFI_SUCCESS;
    }
  }
  gPaths->Mappings.push_back({Name, DevicePath});
  return EFI_SUCCESS;
}

EFI_STATUS ShellMapDelete(const std::u16string &Name) {
  auto &Mappings = gPaths->Mappings;
  auto It = std::find_if(Mappings.begin(), Mappings.end(),
                         [&](const ShellMapping &M) { return HostNameEqual(M.Name, Name); });
  if (It == Mappings.end()) {
    return EFI_NOT_FOUND;
  }
  Mappings.erase(It);
  if (!gPaths->CurrentMapping.empty() && ShellMapFind(gPaths->CurrentMapping) == nullptr) {
    gPaths->CurrentMapping.clear();
  }
  return EFI_SUCCESS;
}

EFI_STATUS ShellOpenMappingRoot(const ShellMapping &Mapping, EFI_FILE_PROTOCOL **Root) {
  *Root = nullptr;
  for (const ShellVolume &V : ShellPresentVolumes()) {
    if (V.DevicePath == Mapping.DevicePath) {
      return ShellOpenVolume(V.Handle, Root);
    }
  }
  return EFI_NOT_FOUND;
}

EFI_STATUS ShellQualify(const std::u16string &Path, std::u16string *Mapping,
                        std::u16string *VolumePath) {
  std::u16string Text = Path;
  std::replace(Text.begin(), Text.end(), u'/', u'\\');
  size_t Colon = Text.find(u':');
  if (Colon != std::u16string::npos) {
    const ShellMapping *Found = ShellMapFind(Text.substr(0, Colon));
    if (Colon == 0 || Found == nullptr) {
      return EFI_NOT_FOUND;
    }
    *Mapping = Found->Name;
    *VolumePath = ShellCleanPath(u"\\" + Text.substr(Colon + 1));
    return EFI_SUCCESS;
  }
  if (gPaths->CurrentMapping.empty() || ShellMapFind(gPaths->CurrentMapping) == nullptr) {
    return EFI_NOT_FOUND;
  }
  *Mapping = gPaths->CurrentMapping;
  bool Absolute = !Text.empty() && Text[0] == u'\\';
  *VolumePath = ShellCleanPath((Absolute ? u"" : ShellCurrentDirOf(*Mapping)) + u"\\" + Text);
  return EFI_SUCCESS;
}

EFI_STATUS ShellOpen(const std::u16string &Path, UINT64 OpenMode, UINT64 Attributes,
                     EFI_FILE_PROTOCOL **File) {
  *File = nullptr;
  std::u16string Mapping, VolumePath;
  EFI_STATUS Status = ShellQualify(Path, &Mapping, &VolumePath);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  EFI_FILE_PROTOCOL *Root = nullptr;
  Status = ShellOpenMappingRoot(*ShellMapFind(Mapping), &Root);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = Root->Open(Root, File, VolumePath.c_str(), OpenMode, Attributes);
  Root->Close(Root);
  if (EFI_ERROR(Status)) {
    *File = nullptr;
  }
  return Status;
}

EFI_STATUS ShellSizedCall(const std::function<EFI_STATUS(UINTN *Size, void *Buffer)> &Call,
                          std::vector<UINT8> *Buffer, UINTN *Size) {
  UINTN Capacity = 512;
  for (int Attempt = 0; Attempt < 4; Attempt++) {
    Buffer->assign(Capacity + sizeof(CHAR16), 0);
    *Size = Capacity;
    EFI_STATUS Status = Call(Size, Buffer->data());
    if (Status == EFI_BUFFER_TOO_SMALL && *Size > Capacity && *Size <= kMaxInfo) {
      Capacity = *Size;
      continue;
    }
    if (!EFI_ERROR(Status) && *Size > Capacity) {
      return EFI_DEVICE_ERROR; // wrote past the buffer it was given
    }
    return Status;
  }
  return EFI_BUFFER_TOO_SMALL;
}

bool ShellValidFileInfo(const std::vector<UINT8> &Info, UINTN Size) {
  return Size >= SIZE_OF_EFI_FILE_INFO && Size <= Info.size() &&
         ShellFileInfo(Info)->Size >= SIZE_OF_EFI_FILE_INFO && ShellFileInfo(Info)->Size <= Size;
}

EFI_STATUS ShellGetInfo(EFI_FILE_PROTOCOL *File, const EFI_GUID &Type, std::vector<UINT8> *Info) {
  UINTN Size = 0;
  EFI_STATUS Status = ShellSizedCall(
      [&](UINTN *Wanted, void *Buffer) { return File->GetInfo(File, &Type, Wanted, Buffer); }, Info,
      &Size);
  if (!EFI_ERROR(Status) && EfiGuidEqual(Type, gEfiFileInfoGuid) &&
      !ShellValidFileInfo(*Info, Size)) {
    return EFI_DEVICE_ERROR;
  }
  return Status;
}

const std::u16string &ShellCurrentMapping() {
  return gPaths->CurrentMapping;
}

std::u16string ShellCurrentDirOf(const std::u16string &Mapping) {
  for (const auto &Entry : gPaths->Directories) {
    if (HostNameEqual(Entry.first, Mapping)) {
      return Entry.second;
    }
  }
  return u"\\";
}

EFI_STATUS ShellSetCurrent(const std::u16string &Mapping, const std::u16string *VolumePath) {
  const ShellMapping *Found = ShellMapFind(Mapping);
  if (Found == nullptr) {
    return EFI_NOT_FOUND;
  }
  gPaths->CurrentMapping = Found->Name;
  if (VolumePath != nullptr) {
    ShellSetDirectoryOf(Found->Name, ShellCleanPath(*VolumePath));
  }
  return EFI_SUCCESS;
}

void HostShellVolumeArrived() {
  if (gPaths != nullptr) {
    ShellMapRefresh(false);
  }
}

void ShellPathsStart(EFI_BOOT_SERVICES *BootServices) {
  ShellPathsStop();
  gPaths = new PathState();
  gPaths->BootServices = BootServices;
  ShellMapRefresh(true);
}

void ShellPathsStop() {
  delete gPaths;
  gPaths = nullptr;
}
