// Volume mapping: the file-system volume whose label matches a wanted name is
// found among all Simple File System handles and given a shell name, either
// the fixed name of the platform's partition table or the wanted name itself.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ShellCommand.h"

// The platform's internal partitions and the fixed shell names they are
// mapped to. Labels are matched on their first 6 characters, so each label
// is unique in those. "ostra1" is the tools partition that the mapping
// refresh changes into.
const NWFS_PARTITION_LABEL gPartitionLabelTable[NWFS_PARTITION_LABEL_COUNT] = {
    {u"OSTRA1", u"ostra1"},   {u"OSTRA2", u"ostra2"},   {u"DIAGNS", u"diags"},
    {u"SVCPCK", u"svcpack"},  {u"DRVPCK", u"drvpack"},  {u"FWUPDT", u"fwupdate"},
    {u"OSIMG1", u"osimage"},  {u"BKPIMG", u"backup"},   {u"CONFIG", u"config"},
    {u"RECOVR", u"recovery"}, {u"SYSLOG", u"syslog"},   {u"INVNTR", u"inventory"},
    {u"CATLOG", u"catalog"},  {u"USRDAT", u"userdata"}, {u"PRVSN1", u"provision"},
    {u"SCRTCH", u"scratch"},
};

namespace {

constexpr UINTN kFileSystemInfoBytes = 136;
constexpr UINTN kCommandChars = NWFS_COMMAND_BYTES / sizeof(CHAR16);
constexpr UINTN kNameBufferChars = NWFS_DRIVE_NAME_CHARS + 1;

bool LabelsAgree(const CHAR16 *A, const CHAR16 *B) {
  return StrnCmp(A, B, NWFS_LABEL_COMPARE_CHARS) == 0;
}

// Reads EFI_FILE_SYSTEM_INFO from an open root into a pool buffer, growing it
// once when the volume asks for more. *Allocated receives the buffer's size.
EFI_STATUS ReadFileSystemInfo(EFI_FILE_PROTOCOL *Root, EFI_FILE_SYSTEM_INFO **Info,
                              UINTN *Allocated) {
  UINTN Size = kFileSystemInfoBytes;
  *Info = static_cast<EFI_FILE_SYSTEM_INFO *>(AllocateZeroPool(Size));
  *Allocated = Size;
  if (*Info == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory alloc for VolumeInfo Failed\n");
    return EFI_OUT_OF_RESOURCES;
  }
  EFI_STATUS Status = Root->GetInfo(Root, &gEfiFileSystemInfoGuid, &Size, *Info);
  if (Status == EFI_BUFFER_TOO_SMALL) {
    DiagLog(DIAG_ALWAYS, "RootFs->GetInfo return Buffer small. Status = 0x%x\n",
            static_cast<UINT32>(Status));
    FreePool(*Info);
    *Info = static_cast<EFI_FILE_SYSTEM_INFO *>(AllocateZeroPool(Size));
    *Allocated = Size;
    if (*Info == nullptr) {
      DiagLog(DIAG_ALWAYS, "Memory alloc for VolumeInfo Failed\n");
      return EFI_OUT_OF_RESOURCES;
    }
    Status = Root->GetInfo(Root, &gEfiFileSystemInfoGuid, &Size, *Info);
  }
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "RootFs->GetInfo failed. Status = 0x%x\n", static_cast<UINT32>(Status));
  } else {
    DiagLog(DIAG_ALWAYS, "RootFs->GetInfo succeeded. Status = 0x%x\n", static_cast<UINT32>(Status));
  }
  return Status;
}

// Copies up to NWFS_DRIVE_NAME_CHARS characters of the label; the label is
// taken only from the bytes the buffer actually holds.
void CopyVolumeLabel(const EFI_FILE_SYSTEM_INFO *Info, UINTN Allocated, CHAR16 *Label) {
  UINTN Room = Allocated > SIZE_OF_EFI_FILE_SYSTEM_INFO
                   ? (Allocated - SIZE_OF_EFI_FILE_SYSTEM_INFO) / sizeof(CHAR16)
                   : 0;
  const CHAR16 *Source = Info->VolumeLabel;
  UINTN Index = 0;
  for (; Index < Room && Index < NWFS_DRIVE_NAME_CHARS && Source[Index] != 0; Index++) {
    Label[Index] = Source[Index];
  }
  Label[Index] = 0;
}

// Length of the first of the shell's ';'-separated names for a device path,
// without its trailing ':'.
UINTN FirstShellNameLength(const CHAR16 *Names) {
  UINTN Length = 0;
  while (Names[Length] != 0 && Names[Length] != u';') {
    Length++;
  }
  if (Length > 0 && Names[Length - 1] == u':') {
    Length--;
  }
  return Length;
}

// The handle among Handles whose volume label agrees with VolumeName, or
// null. A handle whose device path cannot be read ends the search.
EFI_HANDLE FindVolumeByLabel(const CHAR16 *VolumeName, EFI_HANDLE *Handles, UINTN Count,
                             CHAR16 *Label, EFI_DEVICE_PATH_PROTOCOL **DevicePath) {
  for (UINTN Index = 0; Index < Count; Index++) {
    EFI_DEVICE_PATH_PROTOCOL *Path = nullptr;
    EFI_STATUS Status = gBS->HandleProtocol(Handles[Index], &gEfiDevicePathProtocolGuid,
                                            reinterpret_cast<void **>(&Path));
    if (EFI_ERROR(Status)) {
      DiagLog(DIAG_ALWAYS, "Could not get device path, Status = 0x%X\n",
              static_cast<UINT32>(Status));
      return nullptr;
    }
    if (Path == nullptr) {
      DiagLog(DIAG_ALWAYS, "Device path is incorrect\n");
      continue;
    }
    Label[0] = 0;
    GetVolume(Handles[Index], Label);
    DiagLogW(DIAG_ALWAYS, u"partitionLabel = %s\n", Label);
    DiagLogW(DIAG_ALWAYS, u"volumeName = %s\n", VolumeName);
    if (LabelsAgree(Label, VolumeName)) {
      *DevicePath = Path;
      return Handles[Index];
    }
    DiagLogW(DIAG_ALWAYS, u"Checking failed for %s vs %s\n", Label, VolumeName);
  }
  return nullptr;
}

INTN RunMapCommand(const CHAR16 *Format, const CHAR16 *First, const CHAR16 *Second) {
  CHAR16 Command[kCommandChars];
  UnicodeSPrint(Command, kCommandChars, Format, First, Second);
  return RunShellCommand(Command);
}

void CopyIfShorter(CHAR16 *DriveName, UINTN DriveNameChars, const CHAR16 *Name) {
  if (StrLen(Name) < DriveNameChars) {
    StrCpyS(DriveName, DriveNameChars, Name);
  }
}

// Maps the volume under the fixed name of its partition-table row. False
// when no row agrees with the wanted name.
bool MapFromPartitionTable(const CHAR16 *VolumeName, const CHAR16 *ShellName, CHAR16 *DriveName,
                           UINTN DriveNameChars) {
  for (const NWFS_PARTITION_LABEL &Row : gPartitionLabelTable) {
    if (!LabelsAgree(Row.Label, VolumeName)) {
      DiagLogW(DIAG_ALWAYS, u"Did not map, wrong partition name: %s\n", Row.Label);
      continue;
    }
    DiagLogW(DIAG_ALWAYS, u"Mapped %s to %s\n", ShellName, Row.MapName);
    RunMapCommand(u"map %s %s:", Row.MapName, ShellName);
    CHAR16 Command[kCommandChars];
    UnicodeSPrint(Command, kCommandChars, u"vol %s:", ShellName);
    RunShellCommand(Command);
    CopyIfShorter(DriveName, DriveNameChars, Row.MapName);
    return true;
  }
  return false;
}

// Maps the volume under the wanted name itself, falling back to the shell's
// own name.
void MapUnderWantedName(const CHAR16 *VolumeName, const CHAR16 *ShellName, CHAR16 *DriveName,
                        UINTN DriveNameChars) {
  if (RunMapCommand(u"map %s %s:", VolumeName, ShellName) == 0 &&
      StrLen(VolumeName) < DriveNameChars) {
    StrCpyS(DriveName, DriveNameChars, VolumeName);
    DiagLogW(DIAG_ALWAYS, u"Mapping successful. Copying volumeName: %s to driveName: %s.\n",
             VolumeName, DriveName);
    return;
  }
  DiagLogW(DIAG_ALWAYS, u"Could not map %s: to %s. trying to return FSName = %s.\n", VolumeName,
           ShellName, ShellName);
  CopyIfShorter(DriveName, DriveNameChars, ShellName);
}

EFI_SHELL_PROTOCOL *LocateShellForNames() {
  EFI_SHELL_PROTOCOL *Shell = nullptr;
  EFI_STATUS Status =
      gBS->LocateProtocol(&gEfiShellProtocolGuid, nullptr, reinterpret_cast<void **>(&Shell));
  if (Status == EFI_NOT_FOUND) {
    DiagError("\nlocate protocol failed", Status, "GetFS_OLD_NWFS");
  } else if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "\nInitializeVolumeLib failed\n");
  }
  return EFI_ERROR(Status) ? nullptr : Shell;
}

// Steps 4 to 6 for the volume found: its shell name, then the mapping.
EFI_STATUS MapFoundVolume(EFI_SHELL_PROTOCOL *Shell, EFI_DEVICE_PATH_PROTOCOL *DevicePath,
                          const CHAR16 *VolumeName, CHAR16 *ShellName, CHAR16 *DriveName,
                          UINTN DriveNameChars) {
  EFI_DEVICE_PATH_PROTOCOL *Cursor = DevicePath;
  const CHAR16 *Names = Shell->GetMapFromDevicePath(&Cursor);
  if (Names == nullptr) {
    DiagLog(DIAG_ALWAYS, "GetFS:Drive name not found, Status = 0x%X\n",
            static_cast<UINT32>(EFI_NOT_FOUND));
    return EFI_NOT_FOUND;
  }
  // The volume's shell name is the first of the names the shell knows it by.
  const UINTN Length = FirstShellNameLength(Names);
  DiagLogW(DIAG_ALWAYS, u"FSName: %.*s\n", static_cast<int>(Length), Names);
  // The shell name buffer holds NWFS_DRIVE_NAME_CHARS characters at most.
  UINTN Capacity = DriveNameChars < NWFS_DRIVE_NAME_CHARS ? DriveNameChars : NWFS_DRIVE_NAME_CHARS;
  if (Length >= Capacity) {
    DiagLog(DIAG_ALWAYS, "FSName is too long\n");
    return EFI_BUFFER_TOO_SMALL;
  }
  CopyMem(ShellName, Names, Length * sizeof(CHAR16));
  ShellName[Length] = 0;
  if (!MapFromPartitionTable(VolumeName, ShellName, DriveName, DriveNameChars)) {
    MapUnderWantedName(VolumeName, ShellName, DriveName, DriveNameChars);
  }
  return EFI_SUCCESS;
}

} // namespace

EFI_STATUS GetVolume(EFI_HANDLE Handle, CHAR16 *Label) {
  if (Label == nullptr || gBS == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *Fs = nullptr;
  EFI_STATUS Status = gBS->HandleProtocol(Handle, &gEfiSimpleFileSystemProtocolGuid,
                                          reinterpret_cast<void **>(&Fs));
  EFI_FILE_PROTOCOL *Root = nullptr;
  if (!EFI_ERROR(Status)) {
    Status = Fs->OpenVolume(Fs, &Root);
  }
  if (EFI_ERROR(Status) || Root == nullptr) {
    DiagLog(DIAG_ALWAYS, "RootFs->GetInfo failed. Status = 0x%x\n", static_cast<UINT32>(Status));
    return EFI_ERROR(Status) ? Status : EFI_DEVICE_ERROR;
  }
  EFI_FILE_SYSTEM_INFO *Info = nullptr;
  UINTN Allocated = 0;
  Status = ReadFileSystemInfo(Root, &Info, &Allocated);
  if (!EFI_ERROR(Status)) {
    CopyVolumeLabel(Info, Allocated, Label);
  }
  FreePool(Info);
  Root->Close(Root);
  DiagLog(DIAG_ALWAYS, "Exiting from GetVolume() function \n");
  return Status;
}

EFI_STATUS GetFS_OLD_NWFS(const CHAR16 *VolumeName, CHAR16 *DriveName, UINTN DriveNameChars) {
  DiagEntry(DiagChannel::Driver, "GetFS_OLD_NWFS");
  if (VolumeName == nullptr || DriveName == nullptr || DriveNameChars == 0 || gBS == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  CHAR16 *Label = static_cast<CHAR16 *>(AllocateZeroPool(kNameBufferChars * sizeof(CHAR16)));
  CHAR16 *ShellName = static_cast<CHAR16 *>(AllocateZeroPool(kNameBufferChars * sizeof(CHAR16)));
  if (Label == nullptr || ShellName == nullptr) {
    FreePool(Label);
    FreePool(ShellName);
    return EFI_OUT_OF_RESOURCES;
  }
  UINTN Count = 0;
  EFI_HANDLE *Handles = nullptr;
  EFI_STATUS Status = gBS->LocateHandleBuffer(ByProtocol, &gEfiSimpleFileSystemProtocolGuid,
                                              nullptr, &Count, &Handles);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Could not Locate Handle Buffer, Status = 0x%X\n",
            static_cast<UINT32>(Status));
  } else {
    EFI_SHELL_PROTOCOL *Shell = LocateShellForNames();
    EFI_DEVICE_PATH_PROTOCOL *DevicePath = nullptr;
    EFI_HANDLE Found = FindVolumeByLabel(VolumeName, Handles, Count, Label, &DevicePath);
    if (Shell == nullptr) {
      Status = EFI_NOT_FOUND;
    } else if (Found == nullptr) {
      Status = EFI_NOT_FOUND;
    } else {
      Status = MapFoundVolume(Shell, DevicePath, VolumeName, ShellName, DriveName, DriveNameChars);
    }
  }
  FreePool(Label);
  FreePool(ShellName);
  FreePool(Handles);
  DiagLogW(DIAG_ALWAYS, u"Exiting from %a function \n", "GetFS_OLD_NWFS");
  return Status;
}
