// Start-up initialisation and the image's own process environment: the
// shell's variables copied into a name/value table, and its mapping
// variables kept as a list of names and device paths. Everything kept here
// is pool memory released by ReleaseProvisioningEnv before the image returns.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"
#include "ShellCommand.h"

NWFS_MAP_DEVICE *gMapDeviceList = nullptr;

namespace {

constexpr UINTN kNameChars = 256;
constexpr UINTN kDataBytes = 512;
constexpr UINTN kEnvNameChars = 254;

struct NWFS_ENV_ENTRY {
  NWFS_ENV_ENTRY *Next;
  CHAR8 *Name;
  CHAR8 *Value;
};

NWFS_ENV_ENTRY *gEnvList = nullptr;

// The start-up code's own copies of the tables.
EFI_SYSTEM_TABLE *gEnvST = nullptr;
EFI_BOOT_SERVICES *gEnvBS = nullptr;
EFI_RUNTIME_SERVICES *gEnvRT = nullptr;

bool IsPrintable(UINT32 Character) {
  return Character >= 0x20 && Character < 0x7F;
}

// Printable UCS-2: an even size, at least one printable character, and only
// printable characters before the first NUL.
bool IsPrintableUcs2(const UINT8 *Data, UINTN Size) {
  if (Size < sizeof(CHAR16) || Size % sizeof(CHAR16) != 0) {
    return false;
  }
  UINTN Count = 0;
  for (UINTN Index = 0; Index + 1 < Size; Index += 2) {
    UINT32 Character = Data[Index] | (static_cast<UINT32>(Data[Index + 1]) << 8);
    if (Character == 0) {
      break;
    }
    if (!IsPrintable(Character)) {
      return false;
    }
    Count++;
  }
  return Count > 0;
}

bool IsPrintableAscii(const UINT8 *Data, UINTN Size) {
  UINTN Count = 0;
  for (UINTN Index = 0; Index < Size && Data[Index] != 0; Index++) {
    if (!IsPrintable(Data[Index])) {
      return false;
    }
    Count++;
  }
  return Count > 0;
}

// The value as 8-bit text (pool), or null when it is neither kind of text.
CHAR8 *VariableText(const UINT8 *Data, UINTN Size) {
  CHAR8 *Text = nullptr;
  if (IsPrintableUcs2(Data, Size)) {
    UINTN Chars = Size / sizeof(CHAR16);
    Text = static_cast<CHAR8 *>(AllocateZeroPool(Chars + 1));
    for (UINTN Index = 0; Text != nullptr && Index < Chars && Data[2 * Index] != 0; Index++) {
      Text[Index] = static_cast<CHAR8>(Data[2 * Index]);
    }
  } else if (IsPrintableAscii(Data, Size)) {
    Text = static_cast<CHAR8 *>(AllocateZeroPool(Size + 1));
    for (UINTN Index = 0; Text != nullptr && Index < Size && Data[Index] != 0; Index++) {
      Text[Index] = static_cast<CHAR8>(Data[Index]);
    }
  }
  return Text;
}

void FreeEnvEntry(NWFS_ENV_ENTRY *Entry) {
  FreePool(Entry->Name);
  FreePool(Entry->Value);
  FreePool(Entry);
}

void FreeMapDevice(NWFS_MAP_DEVICE *Device) {
  FreePool(Device->MapName);
  FreePool(Device->DevicePath);
  FreePool(Device);
}

NWFS_ENV_ENTRY *FindEnvEntry(const CHAR8 *Name) {
  for (NWFS_ENV_ENTRY *Entry = gEnvList; Entry != nullptr; Entry = Entry->Next) {
    if (AsciiStrCmp(Entry->Name, Name) == 0) {
      return Entry;
    }
  }
  return nullptr;
}

EFI_STATUS AddMapDevice(const CHAR16 *Name, const UINT8 *Data, UINTN Size) {
  NWFS_MAP_DEVICE *Device = static_cast<NWFS_MAP_DEVICE *>(AllocateZeroPool(sizeof(*Device)));
  if (Device == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation to pDev failed\n");
    return EFI_OUT_OF_RESOURCES;
  }
  UINTN NameBytes = StrLen(Name) + 2; // ':' and the terminator
  Device->MapName = static_cast<CHAR8 *>(AllocateZeroPool(NameBytes));
  if (Device->MapName == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation to pDev->MapName failed\n");
    FreeMapDevice(Device);
    return EFI_OUT_OF_RESOURCES;
  }
  UnicodeStrToAsciiS(Name, Device->MapName, NameBytes);
  AsciiStrCatS(Device->MapName, NameBytes, ":");
  Device->DevicePath = static_cast<EFI_DEVICE_PATH_PROTOCOL *>(AllocateCopyPool(Size, Data));
  if (Device->DevicePath == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation to pDev->DevicePath failed\n");
    FreeMapDevice(Device);
    return EFI_OUT_OF_RESOURCES;
  }
  Device->DevicePathSize = Size;
  DiagLog(DIAG_ALWAYS, "pDev->MapName = %a\n", Device->MapName);
  NWFS_MAP_DEVICE **Tail = &gMapDeviceList;
  while (*Tail != nullptr) {
    Tail = &(*Tail)->Next;
  }
  *Tail = Device;
  return EFI_SUCCESS;
}

void CopyEnvVariable(const CHAR16 *Name, const UINT8 *Data, UINTN Size) {
  CHAR8 *Value = VariableText(Data, Size);
  if (Value == nullptr) {
    return;
  }
  CHAR8 NameText[kEnvNameChars + 1];
  UnicodeStrToAsciiS(Name, NameText, sizeof(NameText));
  NwSetEnv(NameText, Value);
  FreePool(Value);
}

// Grows a pool buffer to Size bytes, keeping its first Keep bytes.
bool GrowBuffer(void **Buffer, UINTN Size, UINTN Keep) {
  void *Grown = AllocateZeroPool(Size);
  if (Grown == nullptr) {
    return false;
  }
  CopyMem(Grown, *Buffer, Keep);
  FreePool(*Buffer);
  *Buffer = Grown;
  return true;
}

// Reads one variable into the data buffer, growing it when asked to.
EFI_STATUS ReadEnumeratedVariable(const CHAR16 *Name, const EFI_GUID &Guid, void **Data,
                                  UINTN *Capacity, UINTN *Size) {
  *Size = *Capacity;
  EFI_STATUS Status = gRT->GetVariable(Name, &Guid, nullptr, Size, *Data);
  if (Status == EFI_BUFFER_TOO_SMALL) {
    DiagLog(DIAG_ALWAYS, "Get variable returned buffer too small\n");
    DiagLog(DIAG_ALWAYS, "VariableDataSize = %d\n", static_cast<INT32>(*Size));
    if (!GrowBuffer(Data, *Size, 0)) {
      return EFI_OUT_OF_RESOURCES;
    }
    *Capacity = *Size;
    Status = gRT->GetVariable(Name, &Guid, nullptr, Size, *Data);
  }
  if (!EFI_ERROR(Status) && *Size > *Capacity) {
    Status = EFI_BAD_BUFFER_SIZE; // never trust a size beyond the buffer
  }
  return Status;
}

} // namespace

const CHAR8 *NwGetEnv(const CHAR8 *Name) {
  NWFS_ENV_ENTRY *Entry = Name != nullptr ? FindEnvEntry(Name) : nullptr;
  return Entry != nullptr ? Entry->Value : nullptr;
}

EFI_STATUS NwSetEnv(const CHAR8 *Name, const CHAR8 *Value) {
  if (Name == nullptr || Value == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  CHAR8 *Copy = static_cast<CHAR8 *>(AllocateCopyPool(AsciiStrLen(Value) + 1, Value));
  if (Copy == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  NWFS_ENV_ENTRY *Entry = FindEnvEntry(Name);
  if (Entry != nullptr) {
    FreePool(Entry->Value);
    Entry->Value = Copy;
    return EFI_SUCCESS;
  }
  Entry = static_cast<NWFS_ENV_ENTRY *>(AllocateZeroPool(sizeof(*Entry)));
  CHAR8 *NameCopy = static_cast<CHAR8 *>(AllocateCopyPool(AsciiStrLen(Name) + 1, Name));
  if (Entry == nullptr || NameCopy == nullptr) {
    FreePool(Entry);
    FreePool(NameCopy);
    FreePool(Copy);
    return EFI_OUT_OF_RESOURCES;
  }
  Entry->Name = NameCopy;
  Entry->Value = Copy;
  Entry->Next = gEnvList;
  gEnvList = Entry;
  return EFI_SUCCESS;
}

UINTN NwEnvCount() {
  UINTN Count = 0;
  for (NWFS_ENV_ENTRY *Entry = gEnvList; Entry != nullptr; Entry = Entry->Next) {
    Count++;
  }
  return Count;
}

EFI_STATUS _InitializeEnv() {
  DiagLog(DIAG_ALWAYS, "\nEntered _InitializeEnv\n");
  if (gRT == nullptr) {
    return EFI_NOT_READY;
  }
  UINTN NameCapacity = kNameChars * sizeof(CHAR16);
  UINTN DataCapacity = kDataBytes;
  void *Name = AllocateZeroPool(NameCapacity);
  void *Data = AllocateZeroPool(DataCapacity);
  EFI_STATUS Status = Name != nullptr && Data != nullptr ? EFI_SUCCESS : EFI_OUT_OF_RESOURCES;
  EFI_GUID Guid = {};
  while (!EFI_ERROR(Status)) {
    UINTN NameSize = NameCapacity;
    Status = gRT->GetNextVariableName(&NameSize, static_cast<CHAR16 *>(Name), &Guid);
    if (Status == EFI_BUFFER_TOO_SMALL && NameSize > NameCapacity) {
      Status = GrowBuffer(&Name, NameSize, NameCapacity) ? EFI_SUCCESS : EFI_OUT_OF_RESOURCES;
      NameCapacity = EFI_ERROR(Status) ? NameCapacity : NameSize;
      continue;
    }
    if (Status == EFI_NOT_FOUND) {
      Status = EFI_SUCCESS; // the walk is complete
      break;
    }
    if (EFI_ERROR(Status)) {
      DiagLog(DIAG_ALWAYS, "pRT->GetNextVariableName failed. Status = %d\n",
              static_cast<INT32>(Status));
      break;
    }
    CHAR16 *VariableName = static_cast<CHAR16 *>(Name);
    VariableName[NameCapacity / sizeof(CHAR16) - 1] = 0;
    UINTN DataSize = 0;
    Status = ReadEnumeratedVariable(VariableName, Guid, &Data, &DataCapacity, &DataSize);
    if (EFI_ERROR(Status)) {
      DiagLog(DIAG_ALWAYS, "pRT->GetVariable. Status = %d\n", static_cast<INT32>(Status));
      break;
    }
    if (EfiGuidEqual(Guid, gNwShellMapGuid)) {
      Status = AddMapDevice(VariableName, static_cast<UINT8 *>(Data), DataSize);
    } else {
      CopyEnvVariable(VariableName, static_cast<UINT8 *>(Data), DataSize);
    }
  }
  FreePool(Name);
  FreePool(Data);
  return Status;
}

EFI_STATUS InitializeProvisioningEnv(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable) {
  DiagLog(DIAG_ALWAYS, "\n Entering into IPMI Library \n");
  EFI_STATUS Status = EFI_INVALID_PARAMETER;
  if (SystemTable != nullptr) {
    gEnvST = SystemTable;
    gEnvBS = SystemTable->BootServices;
    gEnvRT = SystemTable->RuntimeServices;
    LocateShellEnvironment("InitializeProvisioningEnv");
    InitializeSystemEnv(ImageHandle, gEnvST);
    _InitializeEnv();
    gIpmiTransport = LocateIpmiTransport(gEnvST);
    Status = InitializeProvisioningVariables();
  }
  DiagLog(DIAG_ALWAYS, "\n Exiting from IPMI Library \n");
  return Status;
}

void ReleaseProvisioningEnv() {
  gIpmiTransport = nullptr; // the firmware's table, not ours to keep past the run
  while (gEnvList != nullptr) {
    NWFS_ENV_ENTRY *Next = gEnvList->Next;
    FreeEnvEntry(gEnvList);
    gEnvList = Next;
  }
  while (gMapDeviceList != nullptr) {
    NWFS_MAP_DEVICE *Next = gMapDeviceList->Next;
    FreeMapDevice(gMapDeviceList);
    gMapDeviceList = Next;
  }
}
