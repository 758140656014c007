// The ramfs: volume of the hosted environment: EFI_SIMPLE_FILE_SYSTEM_PROTOCOL
// and EFI_FILE_PROTOCOL over a host directory, with the semantics firmware
// file systems give (case-insensitive names, '\' separated paths, one
// EFI_FILE_INFO per directory Read).
//
// File handles are the environment's own bookkeeping (new/delete); only the
// information buffers that callers free come from the counted pool, and the
// volume hands out none of those (GetInfo fills the caller's buffer).
#include "HostShellInternal.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <set>

namespace {

// Vendor node identifying the hosted RAM disk.
constexpr EFI_GUID kRamfsVendorGuid = {
    0x3D61A7C2, 0x58B4, 0x4E0F, {0x9C, 0x21, 0x7A, 0x4B, 0xE6, 0x0D, 0x93, 0x58}};
constexpr const char16_t *kRamfsLabel = u"ramfs";
constexpr UINT64 kEndOfFile = 0xFFFFFFFFFFFFFFFFULL;
constexpr INT16 kUnspecifiedTimeZone = 2047;

#pragma pack(push, 1)
struct RamfsDevicePath {
  EFI_DEVICE_PATH_PROTOCOL Vendor;
  EFI_GUID Guid;
  EFI_DEVICE_PATH_PROTOCOL End;
};
#pragma pack(pop)
static_assert(sizeof(RamfsDevicePath) == 24, "vendor node (20) and end node (4)");
static_assert(offsetof(RamfsDevicePath, End) == 20, "end node follows the vendor node");

struct RamfsVolume;

struct RamfsFile {
  EFI_FILE_PROTOCOL Protocol; // first: the handle is the record
  RamfsVolume *Volume;
  std::string Path; // relative to the volume's directory, '/' separated; "" is the root
  bool Directory;
  int Fd; // files only
  UINT64 OpenMode;
  UINT64 Position;                  // files: byte offset; directories: next entry
  std::vector<std::string> Entries; // directory listing taken at the first Read
  bool Listed;
};

struct RamfsVolume {
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL Protocol; // first: the interface is the record
  std::string Directory;
  EFI_HANDLE Handle;
  RamfsDevicePath DevicePath;
  std::set<RamfsFile *> Files;
};

RamfsVolume *gRamfs = nullptr;

EFI_BOOT_SERVICES *BootServices() {
  return HostSystemTable()->BootServices;
}

EFI_STATUS StatusFromErrno(int Error) {
  switch (Error) {
  case ENOENT:
  case ENOTDIR:
    return EFI_NOT_FOUND;
  case EACCES:
  case EPERM:
  case EEXIST:
  case EISDIR:
    return EFI_ACCESS_DENIED;
  case ENOSPC:
  case EDQUOT:
    return EFI_VOLUME_FULL;
  case EROFS:
    return EFI_WRITE_PROTECTED;
  case ENAMETOOLONG:
  case EINVAL:
    return EFI_INVALID_PARAMETER;
  case ENOMEM:
    return EFI_OUT_OF_RESOURCES;
  default:
    return EFI_DEVICE_ERROR;
  }
}

std::string HostPath(const RamfsVolume *Volume, const std::string &Path) {
  return Path.empty() ? Volume->Directory : Volume->Directory + "/" + Path;
}

std::string Parent(const std::string &Path) {
  size_t Slash = Path.rfind('/');
  return Slash == std::string::npos ? std::string() : Path.substr(0, Slash);
}

std::string LastComponent(const std::string &Path) {
  size_t Slash = Path.rfind('/');
  return Slash == std::string::npos ? Path : Path.substr(Slash + 1);
}

std::string Join(const std::string &Directory, const std::string &Name) {
  return Directory.empty() ? Name : Directory + "/" + Name;
}

RamfsFile *FileFrom(EFI_FILE_PROTOCOL *This) {
  RamfsFile *File = reinterpret_cast<RamfsFile *>(This);
  if (gRamfs == nullptr || This == nullptr || gRamfs->Files.count(File) == 0) {
    return nullptr;
  }
  return File;
}

// A component the host could misread: empty, a separator, or control text.
bool ValidComponent(const std::u16string &Name) {
  if (Name.empty()) {
    return false;
  }
  for (char16_t C : Name) {
    if (C < 0x20 || C == u'/' || C == 0x7F) {
      return false;
    }
  }
  return true;
}

// Finds Name in the host directory Directory (relative), exact match first,
// then with ASCII letters folded. Returns the name as stored on the host.
bool FindEntry(const RamfsVolume *Volume, const std::string &Directory, const std::string &Name,
               std::string *Found) {
  struct stat St;
  if (lstat(HostPath(Volume, Join(Directory, Name)).c_str(), &St) == 0) {
    *Found = Name;
    return true;
  }
  DIR *Dir = opendir(HostPath(Volume, Directory).c_str());
  if (Dir == nullptr) {
    return false;
  }
  bool Match = false;
  while (dirent *Entry = readdir(Dir)) {
    if (HostNameEqual(std::string(Entry->d_name), Name)) {
      *Found = Entry->d_name;
      Match = true;
      break;
    }
  }
  closedir(Dir);
  return Match;
}

bool IsDirectory(const RamfsVolume *Volume, const std::string &Path) {
  struct stat St;
  return stat(HostPath(Volume, Path).c_str(), &St) == 0 && S_ISDIR(St.st_mode);
}

// Where a name leads: an existing entry (Missing empty) or the directory in
// which the last component, Missing, would be created.
struct Resolved {
  std::string Path;
  std::string Missing;
};

EFI_STATUS Resolve(const RamfsVolume *Volume, const std::string &Base, bool BaseIsDirectory,
                   const CHAR16 *FileName, Resolved *Out) {
  std::u16string Name(FileName);
  bool Absolute = !Name.empty() && Name[0] == u'\\';
  if (!Absolute && !BaseIsDirectory && !Name.empty()) {
    return EFI_NOT_FOUND; // only directories hold names
  }
  std::string Current = Absolute ? std::string() : Base;
  std::vector<std::u16string> Components = HostSplitPath(Name);
  for (size_t I = 0; I < Components.size(); I++) {
    const std::u16string &Component = Components[I];
    if (Component == u".") {
      continue;
    }
    if (Component == u"..") {
      Current = Parent(Current); // the root's parent is the root
      continue;
    }
    if (!ValidComponent(Component)) {
      return EFI_INVALID_PARAMETER;
    }
    if (!IsDirectory(Volume, Current)) {
      return EFI_NOT_FOUND;
    }
    std::string Wanted = HostUcs2ToUtf8(Component.c_str());
    std::string Found;
    if (!FindEntry(Volume, Current, Wanted, &Found)) {
      if (I + 1 != Components.size()) {
        return EFI_NOT_FOUND;
      }
      Out->Path = Current;
      Out->Missing = Wanted;
      return EFI_SUCCESS;
    }
    Current = Join(Current, Found);
  }
  Out->Path = Current;
  Out->Missing.clear();
  return EFI_SUCCESS;
}

EFI_TIME EfiTime(const timespec &When) {
  EFI_TIME Time = {};
  struct tm Tm;
  time_t Seconds = When.tv_sec;
  if (gmtime_r(&Seconds, &Tm) != nullptr) {
    Time.Year = static_cast<UINT16>(Tm.tm_year + 1900);
    Time.Month = static_cast<UINT8>(Tm.tm_mon + 1);
    Time.Day = static_cast<UINT8>(Tm.tm_mday);
    Time.Hour = static_cast<UINT8>(Tm.tm_hour);
    Time.Minute = static_cast<UINT8>(Tm.tm_min);
    Time.Second = static_cast<UINT8>(Tm.tm_sec);
    Time.Nanosecond = static_cast<UINT32>(When.tv_nsec);
  }
  Time.TimeZone = kUnspecifiedTimeZone;
  return Time;
}

// Builds the EFI_FILE_INFO of a host entry under the given UEFI name.
EFI_STATUS BuildFileInfo(const RamfsVolume *Volume, const std::string &Path,
                         const std::u16string &Name, std::vector<UINT8> *Info) {
  struct stat St;
  if (stat(HostPath(Volume, Path).c_str(), &St) != 0) {
    return StatusFromErrno(errno);
  }
  UINTN Size = SIZE_OF_EFI_FILE_INFO + (Name.size() + 1) * sizeof(CHAR16);
  Info->assign(Size, 0);
  EFI_FILE_INFO *Fi = reinterpret_cast<EFI_FILE_INFO *>(Info->data());
  bool Dir = S_ISDIR(St.st_mode);
  Fi->Size = Size;
  Fi->FileSize = Dir ? 0 : static_cast<UINT64>(St.st_size);
  Fi->PhysicalSize = Dir ? 0 : static_cast<UINT64>(St.st_blocks) * 512;
  Fi->CreateTime = EfiTime(St.st_ctim);
  Fi->LastAccessTime = EfiTime(St.st_atim);
  Fi->ModificationTime = EfiTime(St.st_mtim);
  Fi->Attribute = Dir ? EFI_FILE_DIRECTORY : EFI_FILE_ARCHIVE;
  if ((St.st_mode & S_IWUSR) == 0) {
    Fi->Attribute |= EFI_FILE_READ_ONLY;
  }
  std::memcpy(Info->data() + SIZE_OF_EFI_FILE_INFO, Name.c_str(),
              (Name.size() + 1) * sizeof(CHAR16));
  return EFI_SUCCESS;
}

std::u16string UefiName(const std::string &Path) {
  return Path.empty() ? std::u16string() : HostUtf8ToUcs2(LastComponent(Path).c_str());
}

// Hands Info to the caller's buffer, or asks for a bigger one.
EFI_STATUS ReturnInfo(const std::vector<UINT8> &Info, UINTN *BufferSize, void *Buffer) {
  if (*BufferSize < Info.size()) {
    *BufferSize = Info.size();
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Buffer == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::memcpy(Buffer, Info.data(), Info.size());
  *BufferSize = Info.size();
  return EFI_SUCCESS;
}

EFI_STATUS CreateHandle(RamfsVolume *Volume, const std::string &Path, UINT64 OpenMode,
                        bool JustCreated, EFI_FILE_PROTOCOL **NewHandle);

void DestroyHandle(RamfsFile *File) {
  File->Volume->Files.erase(File);
  if (File->Fd >= 0) {
    close(File->Fd);
  }
  delete File;
}

EFI_STATUS CreateEntry(RamfsVolume *Volume, const std::string &Path, UINT64 Attributes) {
  std::string Host = HostPath(Volume, Path);
  if ((Attributes & EFI_FILE_DIRECTORY) != 0) {
    if (mkdir(Host.c_str(), 0755) != 0) {
      return StatusFromErrno(errno);
    }
  } else {
    int Fd = open(Host.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0644);
    if (Fd < 0) {
      return StatusFromErrno(errno);
    }
    close(Fd);
  }
  if ((Attributes & EFI_FILE_READ_ONLY) != 0) {
    chmod(Host.c_str(), (Attributes & EFI_FILE_DIRECTORY) != 0 ? 0555 : 0444);
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsOpen(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle,
                            const CHAR16 *FileName, UINT64 OpenMode, UINT64 Attributes) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr || NewHandle == nullptr || FileName == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  constexpr UINT64 Read = EFI_FILE_MODE_READ;
  constexpr UINT64 ReadWrite = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;
  if (OpenMode != Read && OpenMode != ReadWrite && OpenMode != (ReadWrite | EFI_FILE_MODE_CREATE)) {
    return EFI_INVALID_PARAMETER;
  }
  bool Create = (OpenMode & EFI_FILE_MODE_CREATE) != 0;
  if (Create && (Attributes & ~EFI_FILE_VALID_ATTR) != 0) {
    return EFI_INVALID_PARAMETER;
  }
  Resolved Target;
  EFI_STATUS Status = Resolve(File->Volume, File->Path, File->Directory, FileName, &Target);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  bool JustCreated = false;
  if (!Target.Missing.empty()) {
    if (!Create) {
      return EFI_NOT_FOUND;
    }
    Target.Path = Join(Target.Path, Target.Missing);
    Status = CreateEntry(File->Volume, Target.Path, Attributes);
    if (EFI_ERROR(Status)) {
      return Status;
    }
    JustCreated = true;
  }
  return CreateHandle(File->Volume, Target.Path, OpenMode, JustCreated, NewHandle);
}

EFI_STATUS EFIAPI RamfsClose(EFI_FILE_PROTOCOL *This) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  DestroyHandle(File);
  return EFI_SUCCESS;
}

// Delete always closes the handle; a refused deletion is only a warning.
EFI_STATUS EFIAPI RamfsDelete(EFI_FILE_PROTOCOL *This) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  bool Allowed = !File->Path.empty() && (File->OpenMode & EFI_FILE_MODE_WRITE) != 0;
  std::string Host = HostPath(File->Volume, File->Path);
  bool Directory = File->Directory;
  DestroyHandle(File);
  if (!Allowed) {
    return EFI_WARN_DELETE_FAILURE;
  }
  int Result = Directory ? rmdir(Host.c_str()) : unlink(Host.c_str());
  return Result == 0 ? EFI_SUCCESS : EFI_WARN_DELETE_FAILURE;
}

void ListDirectory(RamfsFile *File) {
  File->Entries.clear();
  if (DIR *Dir = opendir(HostPath(File->Volume, File->Path).c_str())) {
    while (dirent *Entry = readdir(Dir)) {
      std::string Name = Entry->d_name;
      if (Name != "." && Name != "..") {
        File->Entries.push_back(Name);
      }
    }
    closedir(Dir);
  }
  std::sort(File->Entries.begin(), File->Entries.end());
  // Like a FAT directory, every directory but the root starts with "." and "..".
  if (!File->Path.empty()) {
    File->Entries.insert(File->Entries.begin(), {".", ".."});
  }
  File->Listed = true;
}

EFI_STATUS ReadDirectory(RamfsFile *File, UINTN *BufferSize, void *Buffer) {
  if (!File->Listed) {
    ListDirectory(File);
  }
  while (File->Position < File->Entries.size()) {
    const std::string &Name = File->Entries[File->Position];
    std::string Path = Name == "."    ? File->Path
                       : Name == ".." ? Parent(File->Path)
                                      : Join(File->Path, Name);
    std::vector<UINT8> Info;
    if (EFI_ERROR(BuildFileInfo(File->Volume, Path, HostUtf8ToUcs2(Name.c_str()), &Info))) {
      File->Position++; // removed since the listing was taken
      continue;
    }
    EFI_STATUS Status = ReturnInfo(Info, BufferSize, Buffer);
    if (!EFI_ERROR(Status)) {
      File->Position++;
    }
    return Status;
  }
  *BufferSize = 0;
  return EFI_SUCCESS;
}

// Moves up to Size bytes between Buffer and the file at Offset; stops early
// at the end of the file (reads) or on an error, left in *Error (0 if none).
UINTN Transfer(int Fd, UINT8 *Buffer, UINTN Size, UINT64 Offset, bool Write, int *Error) {
  UINTN Done = 0;
  *Error = 0;
  while (Done < Size) {
    off_t At = static_cast<off_t>(Offset + Done);
    ssize_t Moved = Write ? pwrite(Fd, Buffer + Done, Size - Done, At)
                          : pread(Fd, Buffer + Done, Size - Done, At);
    if (Moved < 0 && errno == EINTR) {
      continue;
    }
    if (Moved <= 0) {
      *Error = Moved < 0 ? errno : 0;
      break;
    }
    Done += static_cast<UINTN>(Moved);
  }
  return Done;
}

// The handle of a Read or Write, when its arguments hold together.
RamfsFile *TransferTarget(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer) {
  RamfsFile *File = FileFrom(This);
  bool Valid = BufferSize != nullptr && (*BufferSize == 0 || Buffer != nullptr);
  return Valid ? File : nullptr;
}

EFI_STATUS EFIAPI RamfsRead(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer) {
  RamfsFile *File = TransferTarget(This, BufferSize, Buffer);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (File->Directory) {
    return ReadDirectory(File, BufferSize, Buffer);
  }
  struct stat St;
  if (fstat(File->Fd, &St) != 0 || File->Position > static_cast<UINT64>(St.st_size)) {
    return EFI_DEVICE_ERROR; // reading from beyond the end
  }
  int Error = 0;
  UINTN Done =
      Transfer(File->Fd, static_cast<UINT8 *>(Buffer), *BufferSize, File->Position, false, &Error);
  if (Error != 0) {
    return EFI_DEVICE_ERROR;
  }
  File->Position += Done;
  *BufferSize = Done;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsWrite(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer) {
  RamfsFile *File = TransferTarget(This, BufferSize, Buffer);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (File->Directory) {
    return EFI_UNSUPPORTED;
  }
  if ((File->OpenMode & EFI_FILE_MODE_WRITE) == 0) {
    return EFI_ACCESS_DENIED;
  }
  int Error = 0;
  UINTN Done =
      Transfer(File->Fd, static_cast<UINT8 *>(Buffer), *BufferSize, File->Position, true, &Error);
  File->Position += Done;
  *BufferSize = Done; // a partial write reports what did get written
  return Error != 0 ? StatusFromErrno(Error) : EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsGetPosition(EFI_FILE_PROTOCOL *This, UINT64 *Position) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr || Position == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (File->Directory) {
    return EFI_UNSUPPORTED;
  }
  *Position = File->Position;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsSetPosition(EFI_FILE_PROTOCOL *This, UINT64 Position) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (File->Directory) {
    if (Position != 0) {
      return EFI_UNSUPPORTED;
    }
    File->Position = 0;
    File->Listed = false; // the next Read lists the directory afresh
    return EFI_SUCCESS;
  }
  if (Position == kEndOfFile) {
    struct stat St;
    if (fstat(File->Fd, &St) != 0) {
      return EFI_DEVICE_ERROR;
    }
    Position = static_cast<UINT64>(St.st_size);
  }
  File->Position = Position;
  return EFI_SUCCESS;
}

EFI_STATUS FileSystemInfo(const RamfsVolume *Volume, std::vector<UINT8> *Info) {
  std::u16string Label = kRamfsLabel;
  UINTN Size = SIZE_OF_EFI_FILE_SYSTEM_INFO + (Label.size() + 1) * sizeof(CHAR16);
  Info->assign(Size, 0);
  EFI_FILE_SYSTEM_INFO *Fs = reinterpret_cast<EFI_FILE_SYSTEM_INFO *>(Info->data());
  struct statvfs Vfs;
  if (statvfs(Volume->Directory.c_str(), &Vfs) != 0) {
    return StatusFromErrno(errno);
  }
  Fs->Size = Size;
  Fs->ReadOnly = FALSE;
  Fs->VolumeSize = static_cast<UINT64>(Vfs.f_blocks) * Vfs.f_frsize;
  Fs->FreeSpace = static_cast<UINT64>(Vfs.f_bavail) * Vfs.f_frsize;
  Fs->BlockSize = static_cast<UINT32>(std::min<unsigned long>(Vfs.f_bsize, 0xFFFFFFFFUL));
  std::memcpy(Info->data() + SIZE_OF_EFI_FILE_SYSTEM_INFO, Label.c_str(),
              (Label.size() + 1) * sizeof(CHAR16));
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsGetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *Type, UINTN *BufferSize,
                               void *Buffer) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr || Type == nullptr || BufferSize == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<UINT8> Info;
  EFI_STATUS Status;
  if (EfiGuidEqual(*Type, gEfiFileInfoGuid)) {
    Status = BuildFileInfo(File->Volume, File->Path, UefiName(File->Path), &Info);
  } else if (EfiGuidEqual(*Type, gEfiFileSystemInfoGuid)) {
    Status = FileSystemInfo(File->Volume, &Info);
  } else if (EfiGuidEqual(*Type, gEfiFileSystemVolumeLabelInfoIdGuid)) {
    std::u16string Label = kRamfsLabel;
    const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Label.c_str());
    Info.assign(Bytes, Bytes + (Label.size() + 1) * sizeof(CHAR16));
    Status = EFI_SUCCESS;
  } else {
    return EFI_UNSUPPORTED;
  }
  if (EFI_ERROR(Status)) {
    return Status;
  }
  return ReturnInfo(Info, BufferSize, Buffer);
}

// The name an EFI_FILE_INFO carries, if it is terminated within its record.
bool InfoName(const EFI_FILE_INFO *Info, UINTN RecordSize, std::u16string *Name) {
  const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Info);
  for (UINTN Offset = SIZE_OF_EFI_FILE_INFO; Offset + sizeof(CHAR16) <= RecordSize;
       Offset += sizeof(CHAR16)) {
    CHAR16 C;
    std::memcpy(&C, Bytes + Offset, sizeof C);
    if (C == 0) {
      return true;
    }
    Name->push_back(C);
  }
  return false;
}

EFI_STATUS Rename(RamfsFile *File, const std::u16string &NewName) {
  if (File->Path.empty()) {
    return EFI_ACCESS_DENIED;
  }
  // A name starting with '\' is a path from the root; otherwise it names the
  // entry anew within its directory.
  Resolved Target;
  EFI_STATUS Status = Resolve(File->Volume, Parent(File->Path), true, NewName.c_str(), &Target);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (Target.Missing.empty()) {
    // Only the entry itself may already answer to the new name (a change of case).
    if (Target.Path != File->Path) {
      return EFI_ACCESS_DENIED;
    }
    size_t Cut = NewName.rfind(u'\\');
    Target.Missing =
        HostUcs2ToUtf8(NewName.substr(Cut == std::u16string::npos ? 0 : Cut + 1).c_str());
    Target.Path = Parent(File->Path);
  }
  std::string NewPath = Join(Target.Path, Target.Missing);
  if (rename(HostPath(File->Volume, File->Path).c_str(), HostPath(File->Volume, NewPath).c_str()) !=
      0) {
    return StatusFromErrno(errno);
  }
  File->Path = NewPath;
  return EFI_SUCCESS;
}

EFI_STATUS SetFileInfo(RamfsFile *File, UINTN BufferSize, const void *Buffer) {
  if (BufferSize < SIZE_OF_EFI_FILE_INFO + sizeof(CHAR16)) {
    return EFI_BAD_BUFFER_SIZE;
  }
  const EFI_FILE_INFO *Info = static_cast<const EFI_FILE_INFO *>(Buffer);
  UINT64 RecordSize = Info->Size;
  std::u16string NewName;
  if (RecordSize < SIZE_OF_EFI_FILE_INFO + sizeof(CHAR16) || RecordSize > BufferSize ||
      !InfoName(Info, static_cast<UINTN>(RecordSize), &NewName) ||
      (NewName.empty() && !File->Path.empty()) || (Info->Attribute & ~EFI_FILE_VALID_ATTR) != 0) {
    return EFI_INVALID_PARAMETER;
  }
  std::vector<UINT8> Current;
  EFI_STATUS Status = BuildFileInfo(File->Volume, File->Path, UefiName(File->Path), &Current);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  const EFI_FILE_INFO *Now = reinterpret_cast<const EFI_FILE_INFO *>(Current.data());
  bool Rename_ = NewName != UefiName(File->Path) && !File->Path.empty();
  bool Resize = Info->FileSize != Now->FileSize;
  bool Protect = (Info->Attribute & EFI_FILE_READ_ONLY) != (Now->Attribute & EFI_FILE_READ_ONLY);
  if ((Info->Attribute & EFI_FILE_DIRECTORY) != (Now->Attribute & EFI_FILE_DIRECTORY)) {
    return EFI_ACCESS_DENIED;
  }
  if ((Rename_ || Resize || Protect) && (File->OpenMode & EFI_FILE_MODE_WRITE) == 0) {
    return EFI_ACCESS_DENIED;
  }
  if (Resize) {
    if (File->Directory) {
      return EFI_ACCESS_DENIED;
    }
    if (ftruncate(File->Fd, static_cast<off_t>(Info->FileSize)) != 0) {
      return StatusFromErrno(errno);
    }
  }
  if (Rename_) {
    Status = Rename(File, NewName);
    if (EFI_ERROR(Status)) {
      return Status;
    }
  }
  if (Protect) {
    bool ReadOnly = (Info->Attribute & EFI_FILE_READ_ONLY) != 0;
    mode_t Mode = File->Directory ? (ReadOnly ? 0555 : 0755) : (ReadOnly ? 0444 : 0644);
    if (chmod(HostPath(File->Volume, File->Path).c_str(), Mode) != 0) {
      return StatusFromErrno(errno);
    }
  }
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsSetInfo(EFI_FILE_PROTOCOL *This, const EFI_GUID *Type, UINTN BufferSize,
                               void *Buffer) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr || Type == nullptr || Buffer == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (EfiGuidEqual(*Type, gEfiFileInfoGuid)) {
    return SetFileInfo(File, BufferSize, Buffer);
  }
  if (EfiGuidEqual(*Type, gEfiFileSystemInfoGuid) ||
      EfiGuidEqual(*Type, gEfiFileSystemVolumeLabelInfoIdGuid)) {
    return EFI_WRITE_PROTECTED; // the label is fixed
  }
  return EFI_UNSUPPORTED;
}

EFI_STATUS EFIAPI RamfsFlush(EFI_FILE_PROTOCOL *This) {
  RamfsFile *File = FileFrom(This);
  if (File == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (!File->Directory && (File->OpenMode & EFI_FILE_MODE_WRITE) == 0) {
    return EFI_ACCESS_DENIED;
  }
  return EFI_SUCCESS;
}

// A new handle on an existing entry.
EFI_STATUS CreateHandle(RamfsVolume *Volume, const std::string &Path, UINT64 OpenMode,
                        bool JustCreated, EFI_FILE_PROTOCOL **NewHandle) {
  struct stat St;
  std::string Host = HostPath(Volume, Path);
  if (stat(Host.c_str(), &St) != 0) {
    return StatusFromErrno(errno);
  }
  bool Dir = S_ISDIR(St.st_mode);
  bool Write = (OpenMode & EFI_FILE_MODE_WRITE) != 0;
  // A read-only file refuses write access, except to the Open that created it.
  if (Write && !Dir && !JustCreated && (St.st_mode & S_IWUSR) == 0) {
    return EFI_ACCESS_DENIED;
  }
  int Fd = -1;
  if (!Dir) {
    Fd = open(Host.c_str(), (Write ? O_RDWR : O_RDONLY) | O_CLOEXEC);
    if (Fd < 0) {
      return StatusFromErrno(errno);
    }
  }
  RamfsFile *File = new RamfsFile();
  File->Protocol = {EFI_FILE_PROTOCOL_REVISION,
                    RamfsOpen,
                    RamfsClose,
                    RamfsDelete,
                    RamfsRead,
                    RamfsWrite,
                    RamfsGetPosition,
                    RamfsSetPosition,
                    RamfsGetInfo,
                    RamfsSetInfo,
                    RamfsFlush};
  File->Volume = Volume;
  File->Path = Path;
  File->Directory = Dir;
  File->Fd = Fd;
  File->OpenMode = OpenMode;
  File->Position = 0;
  File->Listed = false;
  Volume->Files.insert(File);
  *NewHandle = &File->Protocol;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI RamfsOpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root) {
  if (gRamfs == nullptr || This != &gRamfs->Protocol || Root == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status =
      CreateHandle(gRamfs, std::string(), EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE, false, Root);
  return EFI_ERROR(Status) ? EFI_DEVICE_ERROR : Status;
}

} // namespace

EFI_HANDLE HostRamfsInstall(const char *Directory) {
  HostRamfsUninstall();
  std::string Dir = (Directory != nullptr && *Directory != 0) ? Directory : "./ramfs";
  mkdir(Dir.c_str(), 0755); // an existing directory is fine
  while (Dir.size() > 1 && Dir.back() == '/') {
    Dir.pop_back();
  }

  RamfsVolume *Volume = new RamfsVolume();
  Volume->Protocol.Revision = EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION;
  Volume->Protocol.OpenVolume = RamfsOpenVolume;
  Volume->Directory = Dir;
  Volume->Handle = nullptr;
  Volume->DevicePath.Vendor = {HARDWARE_DEVICE_PATH, HW_VENDOR_DP, {20, 0}};
  Volume->DevicePath.Guid = kRamfsVendorGuid;
  Volume->DevicePath.End = {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {4, 0}};

  EFI_STATUS Status = BootServices()->InstallMultipleProtocolInterfaces(
      &Volume->Handle, &gEfiSimpleFileSystemProtocolGuid, &Volume->Protocol,
      &gEfiDevicePathProtocolGuid, &Volume->DevicePath, nullptr);
  if (EFI_ERROR(Status)) {
    delete Volume;
    return nullptr;
  }
  gRamfs = Volume;
  HostShellVolumeArrived();
  return Volume->Handle;
}

void HostRamfsUninstall() {
  if (gRamfs == nullptr) {
    return;
  }
  BootServices()->UninstallMultipleProtocolInterfaces(
      gRamfs->Handle, &gEfiSimpleFileSystemProtocolGuid, &gRamfs->Protocol,
      &gEfiDevicePathProtocolGuid, &gRamfs->DevicePath, nullptr);
  // Handles still open at teardown are closed with the volume.
  while (!gRamfs->Files.empty()) {
    DestroyHandle(*gRamfs->Files.begin());
  }
  delete gRamfs;
  gRamfs = nullptr;
}

EFI_HANDLE HostRamfsHandle() {
  return gRamfs != nullptr ? gRamfs->Handle : nullptr;
}
