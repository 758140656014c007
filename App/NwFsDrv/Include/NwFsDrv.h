// The image's entry, its main routine and the mount module: the records the
// entry installs on the image handle, the share mount and unmount, and the
// driver unload.
#pragma once

#include "Uefi.h"

// The application's main routine. It lives in its own namespace because the
// hosted build links the image into a program that has a global main.
namespace App {
INT32 main(INTN Argc, CHAR8 **Argv);
}

// Share types of the mount layer. main always mounts CIFS; NFS exists only in
// the mount layer.
constexpr UINT32 NWFS_SHARE_TYPE_CIFS = 1;
constexpr UINT32 NWFS_SHARE_TYPE_NFS = 2;

// Accepted argument counts (argument 0, the image name, included) and the
// length from which a single argument is refused.
constexpr INTN NWFS_MIN_ARGUMENTS = 4;
constexpr INTN NWFS_MAX_ARGUMENTS = 9;
constexpr UINTN NWFS_MAX_ARGUMENT_LENGTH = 512;

// ---------------------------------------------------------------------------
// Entry and command line
// ---------------------------------------------------------------------------

// The image entry proper (reports as "ShellCEntryLib"): keeps the firmware
// tables, installs the image's protocols, finds the command line, runs main
// and unloads the driver. EFI_SUCCESS when main returned 0, else
// EFI_UNSUPPORTED.
EFI_STATUS ShellCEntryLib(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);

// Checks the argument count against [Minimum, Maximum] and every argument
// from index 1 for presence and length. The last argument examined decides
// the result: an over-long argument followed by a valid one passes.
EFI_STATUS ValidateArguments(INTN Argc, CHAR8 **Argv, INTN Minimum, INTN Maximum);

// The part of a file path after its first ":\", or the path itself. Prints
// the "Found :\" line (with a trailing line end when TrailingNewline).
const CHAR16 *TrimVolumePrefix(const CHAR16 *Path, bool TrailingNewline);

// The catalog flag handed to the catalog retrieval: only an NFS share name
// with a separator followed by more text sets it.
bool ComputeCatalogFlag(UINT32 ShareType, const CHAR16 *ShareName);

// ---------------------------------------------------------------------------
// Mount module
// ---------------------------------------------------------------------------

// The mount and unmount offered to other firmware components.
struct STATIC_FS_PROTOCOL {
  EFI_STATUS(EFIAPI *MountStaticFileSystem)
  (const CHAR16 *ShareName, const CHAR16 *IpAddress, UINT64 ShareType, const CHAR16 *UserName,
   const CHAR16 *Password);
  EFI_STATUS(EFIAPI *UnmountStaticFileSystem)(const CHAR16 *ShareName, const CHAR16 *IpAddress);
};

// {9246E438-FFD8-42BE-A264-704DDB273B78}
extern const EFI_GUID gStaticFSProtocolGuid;
extern STATIC_FS_PROTOCOL gStaticFSProtocol;

extern EFI_DRIVER_BINDING_PROTOCOL gSimpleFileSystemDriverBinding;
extern EFI_COMPONENT_NAME_PROTOCOL gSimpleFileSystemComponentName;

#pragma pack(push, 1)
// The image's device path: one vendor-style node (type 1, subtype 1) holding
// the driver's GUID and 8 zero bytes, then the end node.
struct NWFS_VENDOR_NODE {
  EFI_DEVICE_PATH_PROTOCOL Header;
  EFI_GUID Guid;
  UINT8 Data[8];
};
struct NWFS_IMAGE_DEVICE_PATH {
  NWFS_VENDOR_NODE Vendor;
  EFI_DEVICE_PATH_PROTOCOL End;
};
#pragma pack(pop)
static_assert(sizeof(NWFS_VENDOR_NODE) == 28, "vendor node is 28 bytes");
static_assert(offsetof(NWFS_VENDOR_NODE, Guid) == 4, "vendor node GUID offset");
static_assert(offsetof(NWFS_VENDOR_NODE, Data) == 20, "vendor node data offset");
static_assert(offsetof(NWFS_IMAGE_DEVICE_PATH, End) == 28, "end node offset");
static_assert(sizeof(NWFS_IMAGE_DEVICE_PATH) == 32, "image device path is 32 bytes");

// {802DE2AB-9404-4851-B91E-89A622D56765}
extern const EFI_GUID gNwFsImageDevicePathGuid;
extern NWFS_IMAGE_DEVICE_PATH gNwFsImageDevicePath;

// Driver binding and component name operations.
EFI_STATUS EFIAPI SimpleFileSystemSupported(EFI_DRIVER_BINDING_PROTOCOL *This,
                                            EFI_HANDLE ControllerHandle,
                                            EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath);
EFI_STATUS EFIAPI SimpleFileSystemStart(EFI_DRIVER_BINDING_PROTOCOL *This,
                                        EFI_HANDLE ControllerHandle,
                                        EFI_DEVICE_PATH_PROTOCOL *RemainingDevicePath);
EFI_STATUS EFIAPI SimpleFileSystemStop(EFI_DRIVER_BINDING_PROTOCOL *This,
                                       EFI_HANDLE ControllerHandle, UINTN NumberOfChildren,
                                       EFI_HANDLE *ChildHandleBuffer);
EFI_STATUS EFIAPI SimpleFileSystemGetDriverName(EFI_COMPONENT_NAME_PROTOCOL *This, CHAR8 *Language,
                                                CHAR16 **DriverName);
EFI_STATUS EFIAPI SimpleFileSystemGetControllerName(EFI_COMPONENT_NAME_PROTOCOL *This,
                                                    EFI_HANDLE ControllerHandle,
                                                    EFI_HANDLE ChildHandle, CHAR8 *Language,
                                                    CHAR16 **ControllerName);

// Installs the device path, then the driver binding and component name, on
// the image handle (two calls, as the entry does).
EFI_STATUS InstallImageProtocols(EFI_HANDLE ImageHandle);

// The share type of the current mount (0 when nothing is mounted) and whether
// the network library has been initialised for it.
extern UINT64 gMountShareType;
extern BOOLEAN gNwLibInitialized;

// Mounts the share as a file-system volume and gives it a shell name. A
// failed mount is retried once with the share name's slashes swapped.
EFI_STATUS StartMountFileSystem(const CHAR16 *ShareName, const CHAR16 *IpAddress, UINT64 ShareType,
                                const CHAR16 *UserName, const CHAR16 *Password);
EFI_STATUS EFIAPI MountStaticFileSystem(const CHAR16 *ShareName, const CHAR16 *IpAddress,
                                        UINT64 ShareType, const CHAR16 *UserName,
                                        const CHAR16 *Password);
// Takes the mounted volume down; succeeds when nothing is mounted. The share
// name is not used.
EFI_STATUS EFIAPI UnmountStaticFileSystem(const CHAR16 *ShareName, const CHAR16 *IpAddress);

// Disconnects the image from every handle and removes the records the entry
// installed.
EFI_STATUS UnloadSimpleFileSystemDriver(EFI_HANDLE ImageHandle);
