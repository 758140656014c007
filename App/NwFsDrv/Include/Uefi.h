// UEFI base types, status codes, tables and the protocols this image uses.
//
// The layouts follow the published UEFI 2.x definitions for x86-64 so that the
// very same records work against real firmware and against the hosted
// environment. Everything the image calls through a table is declared here;
// nothing else from a firmware SDK is needed by the application code.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <stdarg.h>

// The image is built for the Microsoft x64 calling convention, which is what
// firmware uses; the hosted build runs every table in-process with one ABI.
#define EFIAPI

using UINT8 = uint8_t;
using UINT16 = uint16_t;
using UINT32 = uint32_t;
using UINT64 = uint64_t;
using INT8 = int8_t;
using INT16 = int16_t;
using INT32 = int32_t;
using INT64 = int64_t;
using UINTN = uint64_t;
using INTN = int64_t;
using BOOLEAN = uint8_t;
using CHAR8 = char;
using CHAR16 = char16_t;
using VOID = void;

using EFI_STATUS = UINTN;
using EFI_HANDLE = void *;
using EFI_EVENT = void *;
using EFI_TPL = UINTN;
using EFI_LBA = UINT64;
using EFI_PHYSICAL_ADDRESS = UINT64;
using EFI_VIRTUAL_ADDRESS = UINT64;

constexpr BOOLEAN TRUE = 1;
constexpr BOOLEAN FALSE = 0;

struct EFI_GUID {
  UINT32 Data1;
  UINT16 Data2;
  UINT16 Data3;
  UINT8 Data4[8];
};
static_assert(sizeof(EFI_GUID) == 16, "EFI_GUID is 16 bytes");

inline bool EfiGuidEqual(const EFI_GUID &A, const EFI_GUID &B) {
  const UINT8 *Pa = reinterpret_cast<const UINT8 *>(&A);
  const UINT8 *Pb = reinterpret_cast<const UINT8 *>(&B);
  for (int I = 0; I < 16; I++) {
    if (Pa[I] != Pb[I]) {
      return false;
    }
  }
  return true;
}

// ---------------------------------------------------------------------------
// Status codes
// ---------------------------------------------------------------------------
constexpr EFI_STATUS EFI_ERROR_BIT = 0x8000000000000000ULL;
constexpr EFI_STATUS EfiErr(UINTN N) {
  return EFI_ERROR_BIT | N;
}
constexpr bool EFI_ERROR(EFI_STATUS S) {
  return (S & EFI_ERROR_BIT) != 0;
}

constexpr EFI_STATUS EFI_SUCCESS = 0;
constexpr EFI_STATUS EFI_LOAD_ERROR = EfiErr(1);
constexpr EFI_STATUS EFI_INVALID_PARAMETER = EfiErr(2);
constexpr EFI_STATUS EFI_UNSUPPORTED = EfiErr(3);
constexpr EFI_STATUS EFI_BAD_BUFFER_SIZE = EfiErr(4);
constexpr EFI_STATUS EFI_BUFFER_TOO_SMALL = EfiErr(5);
constexpr EFI_STATUS EFI_NOT_READY = EfiErr(6);
constexpr EFI_STATUS EFI_DEVICE_ERROR = EfiErr(7);
constexpr EFI_STATUS EFI_WRITE_PROTECTED = EfiErr(8);
constexpr EFI_STATUS EFI_OUT_OF_RESOURCES = EfiErr(9);
constexpr EFI_STATUS EFI_VOLUME_CORRUPTED = EfiErr(10);
constexpr EFI_STATUS EFI_VOLUME_FULL = EfiErr(11);
constexpr EFI_STATUS EFI_NO_MEDIA = EfiErr(12);
constexpr EFI_STATUS EFI_MEDIA_CHANGED = EfiErr(13);
constexpr EFI_STATUS EFI_NOT_FOUND = EfiErr(14);
constexpr EFI_STATUS EFI_ACCESS_DENIED = EfiErr(15);
constexpr EFI_STATUS EFI_NO_RESPONSE = EfiErr(16);
constexpr EFI_STATUS EFI_NO_MAPPING = EfiErr(17);
constexpr EFI_STATUS EFI_TIMEOUT = EfiErr(18);
constexpr EFI_STATUS EFI_NOT_STARTED = EfiErr(19);
constexpr EFI_STATUS EFI_ALREADY_STARTED = EfiErr(20);
constexpr EFI_STATUS EFI_ABORTED = EfiErr(21);
constexpr EFI_STATUS EFI_ICMP_ERROR = EfiErr(22);
constexpr EFI_STATUS EFI_TFTP_ERROR = EfiErr(23);
constexpr EFI_STATUS EFI_PROTOCOL_ERROR = EfiErr(24);
constexpr EFI_STATUS EFI_INCOMPATIBLE_VERSION = EfiErr(25);
constexpr EFI_STATUS EFI_SECURITY_VIOLATION = EfiErr(26);
constexpr EFI_STATUS EFI_CRC_ERROR = EfiErr(27);
constexpr EFI_STATUS EFI_END_OF_MEDIA = EfiErr(28);
constexpr EFI_STATUS EFI_END_OF_FILE = EfiErr(31);
constexpr EFI_STATUS EFI_INVALID_LANGUAGE = EfiErr(32);
constexpr EFI_STATUS EFI_COMPROMISED_DATA = EfiErr(33);
constexpr EFI_STATUS EFI_CONNECTION_FIN = EfiErr(104);
constexpr EFI_STATUS EFI_CONNECTION_RESET = EfiErr(105);
constexpr EFI_STATUS EFI_CONNECTION_REFUSED = EfiErr(106);

constexpr EFI_STATUS EFI_WARN_UNKNOWN_GLYPH = 1;
constexpr EFI_STATUS EFI_WARN_DELETE_FAILURE = 2;
constexpr EFI_STATUS EFI_WARN_WRITE_FAILURE = 3;
constexpr EFI_STATUS EFI_WARN_BUFFER_TOO_SMALL = 4;

// ---------------------------------------------------------------------------
// Task priority levels, events, memory, variables
// ---------------------------------------------------------------------------
constexpr EFI_TPL TPL_APPLICATION = 4;
constexpr EFI_TPL TPL_CALLBACK = 8;
constexpr EFI_TPL TPL_NOTIFY = 16;
constexpr EFI_TPL TPL_HIGH_LEVEL = 31;

constexpr UINT32 EVT_TIMER = 0x80000000;
constexpr UINT32 EVT_RUNTIME = 0x40000000;
constexpr UINT32 EVT_NOTIFY_WAIT = 0x00000100;
constexpr UINT32 EVT_NOTIFY_SIGNAL = 0x00000200;

enum EFI_TIMER_DELAY : UINT32 { TimerCancel, TimerPeriodic, TimerRelative };

enum EFI_MEMORY_TYPE : UINT32 {
  EfiReservedMemoryType,
  EfiLoaderCode,
  EfiLoaderData,
  EfiBootServicesCode,
  EfiBootServicesData,
  EfiRuntimeServicesCode,
  EfiRuntimeServicesData,
  EfiConventionalMemory,
  EfiUnusableMemory,
  EfiACPIReclaimMemory,
  EfiACPIMemoryNVS,
  EfiMemoryMappedIO,
  EfiMemoryMappedIOPortSpace,
  EfiPalCode,
  EfiPersistentMemory,
  EfiMaxMemoryType
};

enum EFI_ALLOCATE_TYPE : UINT32 { AllocateAnyPages, AllocateMaxAddress, AllocateAddress };

enum EFI_INTERFACE_TYPE : UINT32 { EFI_NATIVE_INTERFACE };

enum EFI_LOCATE_SEARCH_TYPE : UINT32 { AllHandles, ByRegisterNotify, ByProtocol };

enum EFI_RESET_TYPE : UINT32 { EfiResetCold, EfiResetWarm, EfiResetShutdown };

constexpr UINT32 EFI_VARIABLE_NON_VOLATILE = 0x00000001;
constexpr UINT32 EFI_VARIABLE_BOOTSERVICE_ACCESS = 0x00000002;
constexpr UINT32 EFI_VARIABLE_RUNTIME_ACCESS = 0x00000004;

constexpr UINT32 EFI_OPEN_PROTOCOL_BY_HANDLE_PROTOCOL = 0x00000001;
constexpr UINT32 EFI_OPEN_PROTOCOL_GET_PROTOCOL = 0x00000002;
constexpr UINT32 EFI_OPEN_PROTOCOL_TEST_PROTOCOL = 0x00000004;
constexpr UINT32 EFI_OPEN_PROTOCOL_BY_CHILD_CONTROLLER = 0x00000008;
constexpr UINT32 EFI_OPEN_PROTOCOL_BY_DRIVER = 0x00000010;
constexpr UINT32 EFI_OPEN_PROTOCOL_EXCLUSIVE = 0x00000020;

using EFI_EVENT_NOTIFY = void(EFIAPI *)(EFI_EVENT Event, void *Context);

struct EFI_TIME {
  UINT16 Year;
  UINT8 Month;
  UINT8 Day;
  UINT8 Hour;
  UINT8 Minute;
  UINT8 Second;
  UINT8 Pad1;
  UINT32 Nanosecond;
  INT16 TimeZone;
  UINT8 Daylight;
  UINT8 Pad2;
};
static_assert(sizeof(EFI_TIME) == 16, "EFI_TIME is 16 bytes");

struct EFI_TIME_CAPABILITIES {
  UINT32 Resolution;
  UINT32 Accuracy;
  BOOLEAN SetsToZero;
};

struct EFI_TABLE_HEADER {
  UINT64 Signature;
  UINT32 Revision;
  UINT32 HeaderSize;
  UINT32 CRC32;
  UINT32 Reserved;
};
static_assert(sizeof(EFI_TABLE_HEADER) == 24, "EFI_TABLE_HEADER is 24 bytes");

// ---------------------------------------------------------------------------
// Device path
// ---------------------------------------------------------------------------
#pragma pack(push, 1)
struct EFI_DEVICE_PATH_PROTOCOL {
  UINT8 Type;
  UINT8 SubType;
  UINT8 Length[2];
};
#pragma pack(pop)
static_assert(sizeof(EFI_DEVICE_PATH_PROTOCOL) == 4, "device path node header is 4 bytes");

constexpr UINT8 HARDWARE_DEVICE_PATH = 0x01;
constexpr UINT8 HW_VENDOR_DP = 0x04;
constexpr UINT8 MEDIA_DEVICE_PATH = 0x04;
constexpr UINT8 END_DEVICE_PATH_TYPE = 0x7F;
constexpr UINT8 END_ENTIRE_DEVICE_PATH_SUBTYPE = 0xFF;

// ---------------------------------------------------------------------------
// Simple text output
// ---------------------------------------------------------------------------
struct EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL;

struct SIMPLE_TEXT_OUTPUT_MODE {
  INT32 MaxMode;
  INT32 Mode;
  INT32 Attribute;
  INT32 CursorColumn;
  INT32 CursorRow;
  BOOLEAN CursorVisible;
};

struct EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL {
  EFI_STATUS(EFIAPI *Reset)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN ExtendedVerification);
  EFI_STATUS(EFIAPI *OutputString)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String);
  EFI_STATUS(EFIAPI *TestString)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, const CHAR16 *String);
  EFI_STATUS(EFIAPI *QueryMode)
  (EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber, UINTN *Columns, UINTN *Rows);
  EFI_STATUS(EFIAPI *SetMode)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN ModeNumber);
  EFI_STATUS(EFIAPI *SetAttribute)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Attribute);
  EFI_STATUS(EFIAPI *ClearScreen)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This);
  EFI_STATUS(EFIAPI *SetCursorPosition)
  (EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, UINTN Column, UINTN Row);
  EFI_STATUS(EFIAPI *EnableCursor)(EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *This, BOOLEAN Visible);
  SIMPLE_TEXT_OUTPUT_MODE *Mode;
};

struct EFI_SIMPLE_TEXT_INPUT_PROTOCOL; // never used by the image

// ---------------------------------------------------------------------------
// Runtime services
// ---------------------------------------------------------------------------
struct EFI_RUNTIME_SERVICES {
  EFI_TABLE_HEADER Hdr;
  EFI_STATUS(EFIAPI *GetTime)(EFI_TIME *Time, EFI_TIME_CAPABILITIES *Capabilities);
  EFI_STATUS(EFIAPI *SetTime)(EFI_TIME *Time);
  EFI_STATUS(EFIAPI *GetWakeupTime)(BOOLEAN *Enabled, BOOLEAN *Pending, EFI_TIME *Time);
  EFI_STATUS(EFIAPI *SetWakeupTime)(BOOLEAN Enable, EFI_TIME *Time);
  EFI_STATUS(EFIAPI *SetVirtualAddressMap)
  (UINTN MemoryMapSize, UINTN DescriptorSize, UINT32 DescriptorVersion, void *VirtualMap);
  EFI_STATUS(EFIAPI *ConvertPointer)(UINTN DebugDisposition, void **Address);
  EFI_STATUS(EFIAPI *GetVariable)
  (const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 *Attributes, UINTN *DataSize,
   void *Data);
  EFI_STATUS(EFIAPI *GetNextVariableName)
  (UINTN *VariableNameSize, CHAR16 *VariableName, EFI_GUID *VendorGuid);
  EFI_STATUS(EFIAPI *SetVariable)
  (const CHAR16 *VariableName, const EFI_GUID *VendorGuid, UINT32 Attributes, UINTN DataSize,
   const void *Data);
  EFI_STATUS(EFIAPI *GetNextHighMonotonicCount)(UINT32 *HighCount);
  void(EFIAPI *ResetSystem)(EFI_RESET_TYPE ResetType, EFI_STATUS ResetStatus, UINTN DataSize,
                            void *ResetData);
  EFI_STATUS(EFIAPI *UpdateCapsule)
  (void **CapsuleHeaderArray, UINTN CapsuleCount, EFI_PHYSICAL_ADDRESS ScatterGatherList);
  EFI_STATUS(EFIAPI *QueryCapsuleCapabilities)
  (void **CapsuleHeaderArray, UINTN CapsuleCount, UINT64 *MaximumCapsuleSize, UINT32 *ResetType);
  EFI_STATUS(EFIAPI *QueryVariableInfo)
  (UINT32 Attributes, UINT64 *MaximumVariableStorageSize, UINT64 *RemainingVariableStorageSize,
   UINT64 *MaximumVariableSize);
};
static_assert(offsetof(EFI_RUNTIME_SERVICES, GetVariable) == 24 + 6 * 8, "GetVariable slot");
static_assert(sizeof(EFI_RUNTIME_SERVICES) == 24 + 14 * 8, "runtime services table size");

// ---------------------------------------------------------------------------
// Boot services
// ---------------------------------------------------------------------------
struct EFI_OPEN_PROTOCOL_INFORMATION_ENTRY {
  EFI_HANDLE AgentHandle;
  EFI_HANDLE ControllerHandle;
  UINT32 Attributes;
  UINT32 OpenCount;
};

struct EFI_BOOT_SERVICES {
  EFI_TABLE_HEADER Hdr;
  EFI_TPL(EFIAPI *RaiseTPL)(EFI_TPL NewTpl);
  void(EFIAPI *RestoreTPL)(EFI_TPL OldTpl);
  EFI_STATUS(EFIAPI *AllocatePages)
  (EFI_ALLOCATE_TYPE Type, EFI_MEMORY_TYPE MemoryType, UINTN Pages, EFI_PHYSICAL_ADDRESS *Memory);
  EFI_STATUS(EFIAPI *FreePages)(EFI_PHYSICAL_ADDRESS Memory, UINTN Pages);
  EFI_STATUS(EFIAPI *GetMemoryMap)
  (UINTN *MemoryMapSize, void *MemoryMap, UINTN *MapKey, UINTN *DescriptorSize,
   UINT32 *DescriptorVersion);
  EFI_STATUS(EFIAPI *AllocatePool)(EFI_MEMORY_TYPE PoolType, UINTN Size, void **Buffer);
  EFI_STATUS(EFIAPI *FreePool)(void *Buffer);
  EFI_STATUS(EFIAPI *CreateEvent)
  (UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction, void *NotifyContext,
   EFI_EVENT *Event);
  EFI_STATUS(EFIAPI *SetTimer)(EFI_EVENT Event, EFI_TIMER_DELAY Type, UINT64 TriggerTime);
  EFI_STATUS(EFIAPI *WaitForEvent)(UINTN NumberOfEvents, EFI_EVENT *Event, UINTN *Index);
  EFI_STATUS(EFIAPI *SignalEvent)(EFI_EVENT Event);
  EFI_STATUS(EFIAPI *CloseEvent)(EFI_EVENT Event);
  EFI_STATUS(EFIAPI *CheckEvent)(EFI_EVENT Event);
  EFI_STATUS(EFIAPI *InstallProtocolInterface)
  (EFI_HANDLE *Handle, const EFI_GUID *Protocol, EFI_INTERFACE_TYPE InterfaceType, void *Interface);
  EFI_STATUS(EFIAPI *ReinstallProtocolInterface)
  (EFI_HANDLE Handle, const EFI_GUID *Protocol, void *OldInterface, void *NewInterface);
  EFI_STATUS(EFIAPI *UninstallProtocolInterface)
  (EFI_HANDLE Handle, const EFI_GUID *Protocol, void *Interface);
  EFI_STATUS(EFIAPI *HandleProtocol)(EFI_HANDLE Handle, const EFI_GUID *Protocol, void **Interface);
  void *Reserved;
  EFI_STATUS(EFIAPI *RegisterProtocolNotify)
  (const EFI_GUID *Protocol, EFI_EVENT Event, void **Registration);
  EFI_STATUS(EFIAPI *LocateHandle)
  (EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol, void *SearchKey, UINTN *BufferSize,
   EFI_HANDLE *Buffer);
  EFI_STATUS(EFIAPI *LocateDevicePath)
  (const EFI_GUID *Protocol, EFI_DEVICE_PATH_PROTOCOL **DevicePath, EFI_HANDLE *Device);
  EFI_STATUS(EFIAPI *InstallConfigurationTable)(const EFI_GUID *Guid, void *Table);
  EFI_STATUS(EFIAPI *LoadImage)
  (BOOLEAN BootPolicy, EFI_HANDLE ParentImageHandle, EFI_DEVICE_PATH_PROTOCOL *DevicePath,
   void *SourceBuffer, UINTN SourceSize, EFI_HANDLE *ImageHandle);
  EFI_STATUS(EFIAPI *StartImage)(EFI_HANDLE ImageHandle, UINTN *ExitDataSize, CHAR16 **ExitData);
  EFI_STATUS(EFIAPI *Exit)
  (EFI_HANDLE ImageHandle, EFI_STATUS ExitStatus, UINTN ExitDataSize, CHAR16 *ExitData);
  EFI_STATUS(EFIAPI *UnloadImage)(EFI_HANDLE ImageHandle);
  EFI_STATUS(EFIAPI *ExitBootServices)(EFI_HANDLE ImageHandle, UINTN MapKey);
  EFI_STATUS(EFIAPI *GetNextMonotonicCount)(UINT64 *Count);
  EFI_STATUS(EFIAPI *Stall)(UINTN Microseconds);
  EFI_STATUS(EFIAPI *SetWatchdogTimer)
  (UINTN Timeout, UINT64 WatchdogCode, UINTN DataSize, CHAR16 *WatchdogData);
  EFI_STATUS(EFIAPI *ConnectController)
  (EFI_HANDLE ControllerHandle, EFI_HANDLE *DriverImageHandle,
   EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath, BOOLEAN Recursive);
  EFI_STATUS(EFIAPI *DisconnectController)
  (EFI_HANDLE ControllerHandle, EFI_HANDLE DriverImageHandle, EFI_HANDLE ChildHandle);
  EFI_STATUS(EFIAPI *OpenProtocol)
  (EFI_HANDLE Handle, const EFI_GUID *Protocol, void **Interface, EFI_HANDLE AgentHandle,
   EFI_HANDLE ControllerHandle, UINT32 Attributes);
  EFI_STATUS(EFIAPI *CloseProtocol)
  (EFI_HANDLE Handle, const EFI_GUID *Protocol, EFI_HANDLE AgentHandle,
   EFI_HANDLE ControllerHandle);
  EFI_STATUS(EFIAPI *OpenProtocolInformation)
  (EFI_HANDLE Handle, const EFI_GUID *Protocol, EFI_OPEN_PROTOCOL_INFORMATION_ENTRY **EntryBuffer,
   UINTN *EntryCount);
  EFI_STATUS(EFIAPI *ProtocolsPerHandle)
  (EFI_HANDLE Handle, EFI_GUID ***ProtocolBuffer, UINTN *ProtocolBufferCount);
  EFI_STATUS(EFIAPI *LocateHandleBuffer)
  (EFI_LOCATE_SEARCH_TYPE SearchType, const EFI_GUID *Protocol, void *SearchKey, UINTN *NoHandles,
   EFI_HANDLE **Buffer);
  EFI_STATUS(EFIAPI *LocateProtocol)
  (const EFI_GUID *Protocol, void *Registration, void **Interface);
  // Variadic: pairs of (const EFI_GUID *, void *) ended by a null GUID pointer.
  EFI_STATUS(EFIAPI *InstallMultipleProtocolInterfaces)(EFI_HANDLE *Handle, ...);
  EFI_STATUS(EFIAPI *UninstallMultipleProtocolInterfaces)(EFI_HANDLE Handle, ...);
  EFI_STATUS(EFIAPI *CalculateCrc32)(void *Data, UINTN DataSize, UINT32 *Crc32);
  void(EFIAPI *CopyMem)(void *Destination, const void *Source, UINTN Length);
  void(EFIAPI *SetMem)(void *Buffer, UINTN Size, UINT8 Value);
  EFI_STATUS(EFIAPI *CreateEventEx)
  (UINT32 Type, EFI_TPL NotifyTpl, EFI_EVENT_NOTIFY NotifyFunction, const void *NotifyContext,
   const EFI_GUID *EventGroup, EFI_EVENT *Event);
};
static_assert(offsetof(EFI_BOOT_SERVICES, AllocatePool) == 24 + 5 * 8, "AllocatePool slot");
static_assert(offsetof(EFI_BOOT_SERVICES, Stall) == 24 + 28 * 8, "Stall slot");
static_assert(offsetof(EFI_BOOT_SERVICES, OpenProtocol) == 24 + 32 * 8, "OpenProtocol slot");
static_assert(offsetof(EFI_BOOT_SERVICES, LocateProtocol) == 24 + 37 * 8, "LocateProtocol slot");
static_assert(sizeof(EFI_BOOT_SERVICES) == 24 + 44 * 8, "boot services table size");

// ---------------------------------------------------------------------------
// System table
// ---------------------------------------------------------------------------
struct EFI_CONFIGURATION_TABLE {
  EFI_GUID VendorGuid;
  void *VendorTable;
};

struct EFI_SYSTEM_TABLE {
  EFI_TABLE_HEADER Hdr;
  CHAR16 *FirmwareVendor;
  UINT32 FirmwareRevision;
  EFI_HANDLE ConsoleInHandle;
  EFI_SIMPLE_TEXT_INPUT_PROTOCOL *ConIn;
  EFI_HANDLE ConsoleOutHandle;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *ConOut;
  EFI_HANDLE StandardErrorHandle;
  EFI_SIMPLE_TEXT_OUTPUT_PROTOCOL *StdErr;
  EFI_RUNTIME_SERVICES *RuntimeServices;
  EFI_BOOT_SERVICES *BootServices;
  UINTN NumberOfTableEntries;
  EFI_CONFIGURATION_TABLE *ConfigurationTable;
};
static_assert(offsetof(EFI_SYSTEM_TABLE, ConOut) == 64, "ConOut slot");
static_assert(offsetof(EFI_SYSTEM_TABLE, BootServices) == 96, "BootServices slot");
static_assert(sizeof(EFI_SYSTEM_TABLE) == 120, "system table size");

// ---------------------------------------------------------------------------
// Loaded image
// ---------------------------------------------------------------------------
struct EFI_LOADED_IMAGE_PROTOCOL {
  UINT32 Revision;
  EFI_HANDLE ParentHandle;
  EFI_SYSTEM_TABLE *SystemTable;
  EFI_HANDLE DeviceHandle;
  EFI_DEVICE_PATH_PROTOCOL *FilePath;
  void *Reserved;
  UINT32 LoadOptionsSize;
  void *LoadOptions;
  void *ImageBase;
  UINT64 ImageSize;
  EFI_MEMORY_TYPE ImageCodeType;
  EFI_MEMORY_TYPE ImageDataType;
  EFI_STATUS(EFIAPI *Unload)(EFI_HANDLE ImageHandle);
};

// ---------------------------------------------------------------------------
// File protocols and information types
// ---------------------------------------------------------------------------
constexpr UINT64 EFI_FILE_MODE_READ = 0x0000000000000001ULL;
constexpr UINT64 EFI_FILE_MODE_WRITE = 0x0000000000000002ULL;
constexpr UINT64 EFI_FILE_MODE_CREATE = 0x8000000000000000ULL;

constexpr UINT64 EFI_FILE_READ_ONLY = 0x01;
constexpr UINT64 EFI_FILE_HIDDEN = 0x02;
constexpr UINT64 EFI_FILE_SYSTEM = 0x04;
constexpr UINT64 EFI_FILE_RESERVED = 0x08;
constexpr UINT64 EFI_FILE_DIRECTORY = 0x10;
constexpr UINT64 EFI_FILE_ARCHIVE = 0x20;
constexpr UINT64 EFI_FILE_VALID_ATTR = 0x37;

constexpr UINT64 EFI_FILE_PROTOCOL_REVISION = 0x00010000;
constexpr UINT64 EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION = 0x00010000;

struct EFI_FILE_PROTOCOL {
  UINT64 Revision;
  EFI_STATUS(EFIAPI *Open)
  (EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle, const CHAR16 *FileName, UINT64 OpenMode,
   UINT64 Attributes);
  EFI_STATUS(EFIAPI *Close)(EFI_FILE_PROTOCOL *This);
  EFI_STATUS(EFIAPI *Delete)(EFI_FILE_PROTOCOL *This);
  EFI_STATUS(EFIAPI *Read)(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer);
  EFI_STATUS(EFIAPI *Write)(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer);
  EFI_STATUS(EFIAPI *GetPosition)(EFI_FILE_PROTOCOL *This, UINT64 *Position);
  EFI_STATUS(EFIAPI *SetPosition)(EFI_FILE_PROTOCOL *This, UINT64 Position);
  EFI_STATUS(EFIAPI *GetInfo)
  (EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN *BufferSize, void *Buffer);
  EFI_STATUS(EFIAPI *SetInfo)
  (EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType, UINTN BufferSize, void *Buffer);
  EFI_STATUS(EFIAPI *Flush)(EFI_FILE_PROTOCOL *This);
};
static_assert(sizeof(EFI_FILE_PROTOCOL) == 11 * 8, "revision-1 file protocol");

struct EFI_SIMPLE_FILE_SYSTEM_PROTOCOL {
  UINT64 Revision;
  EFI_STATUS(EFIAPI *OpenVolume)(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root);
};

#pragma pack(push, 1)
// The three information records are variable-sized: the name runs on past the
// declared one-character array. They are declared packed only to pin the
// published offsets; their natural layout is identical.
struct EFI_FILE_INFO {
  UINT64 Size;
  UINT64 FileSize;
  UINT64 PhysicalSize;
  EFI_TIME CreateTime;
  EFI_TIME LastAccessTime;
  EFI_TIME ModificationTime;
  UINT64 Attribute;
  CHAR16 FileName[1];
};

struct EFI_FILE_SYSTEM_INFO {
  UINT64 Size;
  BOOLEAN ReadOnly;
  UINT8 Pad[7];
  UINT64 VolumeSize;
  UINT64 FreeSpace;
  UINT32 BlockSize;
  CHAR16 VolumeLabel[1];
};

struct EFI_FILE_SYSTEM_VOLUME_LABEL {
  CHAR16 VolumeLabel[1];
};
#pragma pack(pop)
constexpr UINTN SIZE_OF_EFI_FILE_INFO = 80;
constexpr UINTN SIZE_OF_EFI_FILE_SYSTEM_INFO = 36;
static_assert(offsetof(EFI_FILE_INFO, Attribute) == 72, "EFI_FILE_INFO.Attribute");
static_assert(offsetof(EFI_FILE_INFO, FileName) == SIZE_OF_EFI_FILE_INFO, "EFI_FILE_INFO name");
static_assert(offsetof(EFI_FILE_SYSTEM_INFO, VolumeSize) == 16, "EFI_FILE_SYSTEM_INFO size");
static_assert(offsetof(EFI_FILE_SYSTEM_INFO, VolumeLabel) == SIZE_OF_EFI_FILE_SYSTEM_INFO,
              "EFI_FILE_SYSTEM_INFO label");

// ---------------------------------------------------------------------------
// Shell protocols (the current shell interface; the older shell environment
// protocols no longer exist in firmware and are only located, never used)
// ---------------------------------------------------------------------------
using SHELL_FILE_HANDLE = void *;

struct EFI_SHELL_FILE_INFO;

struct EFI_SHELL_PROTOCOL {
  EFI_STATUS(EFIAPI *Execute)
  (EFI_HANDLE *ParentImageHandle, CHAR16 *CommandLine, CHAR16 **Environment, EFI_STATUS *Status);
  const CHAR16 *(EFIAPI *GetEnv)(const CHAR16 *Name);
  EFI_STATUS(EFIAPI *SetEnv)(const CHAR16 *Name, const CHAR16 *Value, BOOLEAN Volatile);
  const CHAR16 *(EFIAPI *GetAlias)(const CHAR16 *Alias, BOOLEAN *Volatile);
  EFI_STATUS(EFIAPI *SetAlias)
  (const CHAR16 *Command, const CHAR16 *Alias, BOOLEAN Replace, BOOLEAN Volatile);
  EFI_STATUS(EFIAPI *GetHelpText)
  (const CHAR16 *Command, const CHAR16 *Sections, CHAR16 **HelpText);
  const EFI_DEVICE_PATH_PROTOCOL *(EFIAPI *GetDevicePathFromMap)(const CHAR16 *Mapping);
  const CHAR16 *(EFIAPI *GetMapFromDevicePath)(EFI_DEVICE_PATH_PROTOCOL **DevicePath);
  EFI_DEVICE_PATH_PROTOCOL *(EFIAPI *GetDevicePathFromFilePath)(const CHAR16 *Path);
  CHAR16 *(EFIAPI *GetFilePathFromDevicePath)(const EFI_DEVICE_PATH_PROTOCOL *Path);
  EFI_STATUS(EFIAPI *SetMap)(const EFI_DEVICE_PATH_PROTOCOL *DevicePath, const CHAR16 *Mapping);
  const CHAR16 *(EFIAPI *GetCurDir)(const CHAR16 *FileSystemMapping);
  EFI_STATUS(EFIAPI *SetCurDir)(const CHAR16 *FileSystem, const CHAR16 *Dir);
  EFI_STATUS(EFIAPI *OpenFileList)
  (CHAR16 *Path, UINT64 OpenMode, EFI_SHELL_FILE_INFO **FileList);
  EFI_STATUS(EFIAPI *FreeFileList)(EFI_SHELL_FILE_INFO **FileList);
  EFI_STATUS(EFIAPI *RemoveDupInFileList)(EFI_SHELL_FILE_INFO **FileList);
  BOOLEAN(EFIAPI *BatchIsActive)();
  BOOLEAN(EFIAPI *IsRootShell)();
  void(EFIAPI *EnablePageBreak)();
  void(EFIAPI *DisablePageBreak)();
  BOOLEAN(EFIAPI *GetPageBreak)();
  EFI_STATUS(EFIAPI *GetDeviceName)
  (EFI_HANDLE DeviceHandle, UINT32 Flags, CHAR8 *Language, CHAR16 **BestDeviceName);
  EFI_FILE_INFO *(EFIAPI *GetFileInfo)(SHELL_FILE_HANDLE FileHandle);
  EFI_STATUS(EFIAPI *SetFileInfo)(SHELL_FILE_HANDLE FileHandle, const EFI_FILE_INFO *FileInfo);
  EFI_STATUS(EFIAPI *OpenFileByName)
  (const CHAR16 *FileName, SHELL_FILE_HANDLE *FileHandle, UINT64 OpenMode);
  EFI_STATUS(EFIAPI *CloseFile)(SHELL_FILE_HANDLE FileHandle);
  EFI_STATUS(EFIAPI *CreateFile)
  (const CHAR16 *FileName, UINT64 FileAttribs, SHELL_FILE_HANDLE *FileHandle);
  EFI_STATUS(EFIAPI *ReadFile)(SHELL_FILE_HANDLE FileHandle, UINTN *ReadSize, void *Buffer);
  EFI_STATUS(EFIAPI *WriteFile)(SHELL_FILE_HANDLE FileHandle, UINTN *BufferSize, void *Buffer);
  EFI_STATUS(EFIAPI *DeleteFile)(SHELL_FILE_HANDLE FileHandle);
  EFI_STATUS(EFIAPI *DeleteFileByName)(const CHAR16 *FileName);
  EFI_STATUS(EFIAPI *GetFilePosition)(SHELL_FILE_HANDLE FileHandle, UINT64 *Position);
  EFI_STATUS(EFIAPI *SetFilePosition)(SHELL_FILE_HANDLE FileHandle, UINT64 Position);
  EFI_STATUS(EFIAPI *FlushFile)(SHELL_FILE_HANDLE FileHandle);
  EFI_STATUS(EFIAPI *FindFiles)(const CHAR16 *FilePattern, EFI_SHELL_FILE_INFO **FileList);
  EFI_STATUS(EFIAPI *FindFilesInDir)
  (SHELL_FILE_HANDLE FileDirHandle, EFI_SHELL_FILE_INFO **FileList);
  EFI_STATUS(EFIAPI *GetFileSize)(SHELL_FILE_HANDLE FileHandle, UINT64 *Size);
  EFI_STATUS(EFIAPI *OpenRoot)
  (EFI_DEVICE_PATH_PROTOCOL *DevicePath, SHELL_FILE_HANDLE *FileHandle);
  EFI_STATUS(EFIAPI *OpenRootByHandle)(EFI_HANDLE DeviceHandle, SHELL_FILE_HANDLE *FileHandle);
  EFI_EVENT ExecutionBreak;
  UINT32 MajorVersion;
  UINT32 MinorVersion;
  // Shell 2.1 and later.
  EFI_STATUS(EFIAPI *RegisterGuidName)(const EFI_GUID *Guid, const CHAR16 *GuidName);
  EFI_STATUS(EFIAPI *GetGuidName)(const EFI_GUID *Guid, const CHAR16 **GuidName);
  EFI_STATUS(EFIAPI *GetGuidFromName)(const CHAR16 *GuidName, EFI_GUID *Guid);
  const CHAR16 *(EFIAPI *GetEnvEx)(const CHAR16 *Name, UINT32 *Attributes);
};
static_assert(offsetof(EFI_SHELL_PROTOCOL, GetMapFromDevicePath) == 7 * 8, "GetMapFromDevicePath");
static_assert(offsetof(EFI_SHELL_PROTOCOL, OpenFileByName) == 24 * 8, "OpenFileByName slot");
static_assert(offsetof(EFI_SHELL_PROTOCOL, ExecutionBreak) == 39 * 8, "ExecutionBreak slot");

struct EFI_SHELL_PARAMETERS_PROTOCOL {
  CHAR16 **Argv;
  UINTN Argc;
  SHELL_FILE_HANDLE StdIn;
  SHELL_FILE_HANDLE StdOut;
  SHELL_FILE_HANDLE StdErr;
};

// ---------------------------------------------------------------------------
// Unicode collation (revision 2: RFC 4646 language codes)
// ---------------------------------------------------------------------------
struct EFI_UNICODE_COLLATION_PROTOCOL {
  INTN(EFIAPI *StriColl)(EFI_UNICODE_COLLATION_PROTOCOL *This, CHAR16 *Str1, CHAR16 *Str2);
  BOOLEAN(EFIAPI *MetaiMatch)
  (EFI_UNICODE_COLLATION_PROTOCOL *This, CHAR16 *String, CHAR16 *Pattern);
  void(EFIAPI *StrLwr)(EFI_UNICODE_COLLATION_PROTOCOL *This, CHAR16 *Str);
  void(EFIAPI *StrUpr)(EFI_UNICODE_COLLATION_PROTOCOL *This, CHAR16 *Str);
  void(EFIAPI *FatToStr)(EFI_UNICODE_COLLATION_PROTOCOL *This, UINTN FatSize, CHAR8 *Fat,
                         CHAR16 *String);
  BOOLEAN(EFIAPI *StrToFat)
  (EFI_UNICODE_COLLATION_PROTOCOL *This, CHAR16 *String, UINTN FatSize, CHAR8 *Fat);
  CHAR8 *SupportedLanguages;
};

// ---------------------------------------------------------------------------
// Driver model
// ---------------------------------------------------------------------------
struct EFI_DRIVER_BINDING_PROTOCOL {
  EFI_STATUS(EFIAPI *Supported)
  (EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE ControllerHandle,
   EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath);
  EFI_STATUS(EFIAPI *Start)
  (EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE ControllerHandle,
   EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath);
  EFI_STATUS(EFIAPI *Stop)
  (EFI_DRIVER_BINDING_PROTOCOL *This, EFI_HANDLE ControllerHandle, UINTN NumberOfChildren,
   EFI_HANDLE *ChildHandleBuffer);
  UINT32 Version;
  EFI_HANDLE ImageHandle;
  EFI_HANDLE DriverBindingHandle;
};

struct EFI_COMPONENT_NAME_PROTOCOL {
  EFI_STATUS(EFIAPI *GetDriverName)
  (EFI_COMPONENT_NAME_PROTOCOL *This, CHAR8 *Language, CHAR16 **DriverName);
  EFI_STATUS(EFIAPI *GetControllerName)
  (EFI_COMPONENT_NAME_PROTOCOL *This, EFI_HANDLE ControllerHandle, EFI_HANDLE ChildHandle,
   CHAR8 *Language, CHAR16 **ControllerName);
  CHAR8 *SupportedLanguages;
};

// ---------------------------------------------------------------------------
// Published GUIDs (defined once, in UefiGuids.cpp)
// ---------------------------------------------------------------------------
extern const EFI_GUID gEfiLoadedImageProtocolGuid;
extern const EFI_GUID gEfiDevicePathProtocolGuid;
extern const EFI_GUID gEfiSimpleFileSystemProtocolGuid;
extern const EFI_GUID gEfiFileInfoGuid;
extern const EFI_GUID gEfiFileSystemInfoGuid;
extern const EFI_GUID gEfiFileSystemVolumeLabelInfoIdGuid;
extern const EFI_GUID gEfiShellProtocolGuid;
extern const EFI_GUID gEfiShellParametersProtocolGuid;
extern const EFI_GUID gEfiUnicodeCollation2ProtocolGuid;
extern const EFI_GUID gEfiDriverBindingProtocolGuid;
extern const EFI_GUID gEfiComponentNameProtocolGuid;
extern const EFI_GUID gEfiGlobalVariableGuid;
extern const EFI_GUID gEfiSmbiosTableGuid;
extern const EFI_GUID gEfiSmbios3TableGuid;
