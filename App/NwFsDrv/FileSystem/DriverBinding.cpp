// The records the image installs: the driver binding and component name, the
// image's device path and gStaticFSProtocol (the mount and unmount offered to
// other firmware components), and the driver unload.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "volume/NwVolume.h"

const EFI_GUID gStaticFSProtocolGuid = {
    0x9246E438, 0xFFD8, 0x42BE, {0xA2, 0x64, 0x70, 0x4D, 0xDB, 0x27, 0x3B, 0x78}};

namespace {
constexpr EFI_GUID kImageDevicePathGuid = {
    0x802DE2AB, 0x9404, 0x4851, {0xB9, 0x1E, 0x89, 0xA6, 0x22, 0xD5, 0x67, 0x65}};
}
const EFI_GUID gNwFsImageDevicePathGuid = kImageDevicePathGuid;

STATIC_FS_PROTOCOL gStaticFSProtocol = {MountStaticFileSystem, UnmountStaticFileSystem};

EFI_DRIVER_BINDING_PROTOCOL gSimpleFileSystemDriverBinding = {SimpleFileSystemSupported,
                                                              SimpleFileSystemStart,
                                                              SimpleFileSystemStop,
                                                              0x10000,
                                                              nullptr,
                                                              nullptr};

EFI_COMPONENT_NAME_PROTOCOL gSimpleFileSystemComponentName = {
    SimpleFileSystemGetDriverName, SimpleFileSystemGetControllerName, const_cast<CHAR8 *>("eng")};

NWFS_IMAGE_DEVICE_PATH gNwFsImageDevicePath = {
    {{0x01, 0x01, {sizeof(NWFS_VENDOR_NODE), 0}}, kImageDevicePathGuid, {0, 0, 0, 0, 0, 0, 0, 0}},
    {END_DEVICE_PATH_TYPE, END_ENTIRE_DEVICE_PATH_SUBTYPE, {sizeof(EFI_DEVICE_PATH_PROTOCOL), 0}}};

namespace {

constexpr UINTN kLanguageCompareChars = 3;
constexpr const CHAR16 *kDriverName = u"PIOMISKU File System Driver";
constexpr const CHAR16 *kDefaultControllerName = u"FAT File System";

BOOLEAN gSimpleFileSystemStarted = FALSE;
EFI_HANDLE gStaticFSHandle = nullptr;

bool LanguageIsEnglish(const CHAR8 *Language) {
  return Language != nullptr && AsciiStrnCmp(Language, "eng", kLanguageCompareChars) == 0;
}

} // namespace

// ---------------------------------------------------------------------------
// Driver binding and component name
// ---------------------------------------------------------------------------

EFI_STATUS EFIAPI SimpleFileSystemSupported(EFI_DRIVER_BINDING_PROTOCOL *, EFI_HANDLE,
                                            EFI_DEVICE_PATH_PROTOCOL *) {
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SimpleFileSystemStart(EFI_DRIVER_BINDING_PROTOCOL *This,
                                        EFI_HANDLE ControllerHandle, EFI_DEVICE_PATH_PROTOCOL *) {
  if (gSimpleFileSystemStarted) {
    return EFI_ALREADY_STARTED;
  }
  DiagLog(DIAG_ALWAYS, "*** SimpleFileSystemStart, Controller: 0x%x\n",
          static_cast<UINT32>(reinterpret_cast<UINTN>(ControllerHandle)));
  DiagLog(DIAG_ALWAYS, "gEfiDevicePathProtocolGuid: 0x%x\n",
          static_cast<UINT32>(reinterpret_cast<UINTN>(&gEfiDevicePathProtocolGuid)));
  DiagLog(DIAG_ALWAYS, "This->DriverBindingHandle: 0x%x\n",
          static_cast<UINT32>(reinterpret_cast<UINTN>(This->DriverBindingHandle)));
  void *DevicePath = nullptr;
  EFI_STATUS Status =
      gBS->OpenProtocol(ControllerHandle, &gEfiDevicePathProtocolGuid, &DevicePath,
                        This->DriverBindingHandle, ControllerHandle, EFI_OPEN_PROTOCOL_BY_DRIVER);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "OpenProtocol, Controller: 0x%x, Status: 0x%x\n",
            static_cast<UINT32>(reinterpret_cast<UINTN>(ControllerHandle)),
            static_cast<UINT32>(Status));
    Status = EFI_UNSUPPORTED;
  } else {
    gStaticFSHandle = nullptr;
    Status = gBS->InstallProtocolInterface(&gStaticFSHandle, &gStaticFSProtocolGuid,
                                           EFI_NATIVE_INTERFACE, &gStaticFSProtocol);
    DiagLog(DIAG_VERBOSE, "InstallProtocolInterface, gStaticFSProtocol: 0x%x, Status: 0x%x\n",
            static_cast<UINT32>(reinterpret_cast<UINTN>(&gStaticFSProtocol)),
            static_cast<UINT32>(Status));
    gSimpleFileSystemStarted = TRUE;
  }
  DiagLog(DIAG_ALWAYS, "Exiting isStarted: %d, Status: 0x%x\n", gSimpleFileSystemStarted,
          static_cast<UINT32>(Status));
  return Status;
}

EFI_STATUS EFIAPI SimpleFileSystemStop(EFI_DRIVER_BINDING_PROTOCOL *This,
                                       EFI_HANDLE ControllerHandle, UINTN NumberOfChildren,
                                       EFI_HANDLE *) {
  if (NumberOfChildren != 0) {
    return EFI_UNSUPPORTED;
  }
  if (gStaticFSHandle != nullptr) {
    gBS->UninstallProtocolInterface(gStaticFSHandle, &gStaticFSProtocolGuid, &gStaticFSProtocol);
    gStaticFSHandle = nullptr;
  }
  gBS->CloseProtocol(ControllerHandle, &gEfiDevicePathProtocolGuid, This->DriverBindingHandle,
                     ControllerHandle);
  gSimpleFileSystemStarted = FALSE;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SimpleFileSystemGetDriverName(EFI_COMPONENT_NAME_PROTOCOL *, CHAR8 *Language,
                                                CHAR16 **DriverName) {
  if (DriverName == nullptr || !LanguageIsEnglish(Language)) {
    return EFI_UNSUPPORTED;
  }
  *DriverName = const_cast<CHAR16 *>(kDriverName);
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SimpleFileSystemGetControllerName(EFI_COMPONENT_NAME_PROTOCOL *,
                                                    EFI_HANDLE ControllerHandle,
                                                    EFI_HANDLE ChildHandle, CHAR8 *Language,
                                                    CHAR16 **ControllerName) {
  if (ChildHandle != nullptr || ControllerName == nullptr || Language == nullptr) {
    return EFI_UNSUPPORTED;
  }
  void *Volume = nullptr;
  EFI_STATUS Status =
      gBS->OpenProtocol(ControllerHandle, &gEfiSimpleFileSystemProtocolGuid, &Volume, gImageHandle,
                        ControllerHandle, EFI_OPEN_PROTOCOL_GET_PROTOCOL);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  // Only a volume of this image carries the record behind the interface.
  NW_VOLUME *Record = static_cast<NW_VOLUME *>(Volume);
  if (Record == nullptr || Record->Sfs.OpenVolume != OpenVolume ||
      AsciiStrnCmp(Record->Language, Language, kLanguageCompareChars) != 0) {
    return EFI_UNSUPPORTED;
  }
  *ControllerName = Record->ControllerName != nullptr
                        ? Record->ControllerName
                        : const_cast<CHAR16 *>(kDefaultControllerName);
  return EFI_SUCCESS;
}

EFI_STATUS InstallImageProtocols(EFI_HANDLE ImageHandle) {
  gSimpleFileSystemDriverBinding.ImageHandle = ImageHandle;
  gSimpleFileSystemDriverBinding.DriverBindingHandle = ImageHandle;
  EFI_HANDLE Handle = ImageHandle;
  EFI_STATUS Status = gBS->InstallMultipleProtocolInterfaces(&Handle, &gEfiDevicePathProtocolGuid,
                                                             &gNwFsImageDevicePath, nullptr);
  if (EFI_ERROR(Status)) {
    DiagError("\nInstalling the image device path failed!", Status, "ShellCEntryLib");
  }
  Status = gBS->InstallMultipleProtocolInterfaces(
      &Handle, &gEfiDriverBindingProtocolGuid, &gSimpleFileSystemDriverBinding,
      &gEfiComponentNameProtocolGuid, &gSimpleFileSystemComponentName, nullptr);
  if (EFI_ERROR(Status)) {
    DiagError("\nInstalling the driver binding failed!", Status, "ShellCEntryLib");
  }
  return Status;
}

EFI_STATUS UnloadSimpleFileSystemDriver(EFI_HANDLE ImageHandle) {
  DiagEntry(DiagChannel::Driver, "UnloadSimpleFileSystemDriver");
  UINTN Count = 0;
  EFI_HANDLE *Handles = nullptr;
  EFI_STATUS Status = gBS->LocateHandleBuffer(AllHandles, nullptr, nullptr, &Count, &Handles);
  if (EFI_ERROR(Status)) {
    DiagError("\nLocateHandleBuffer() failed - exiting from unloadsimplefilesystemprotocol()",
              Status, "UnloadSimpleFileSystemDriver");
    return Status;
  }
  for (UINTN Index = 0; Index < Count; Index++) {
    Status = gBS->DisconnectController(Handles[Index], ImageHandle, nullptr);
  }
  FreePool(Handles);
  Status = gBS->UninstallProtocolInterface(ImageHandle, &gEfiDevicePathProtocolGuid,
                                           &gNwFsImageDevicePath);
  Status = gBS->UninstallMultipleProtocolInterfaces(
      ImageHandle, &gEfiDriverBindingProtocolGuid, &gSimpleFileSystemDriverBinding,
      &gEfiComponentNameProtocolGuid, &gSimpleFileSystemComponentName, nullptr);
  DiagExit(Status, DiagChannel::Driver, "UnloadSimpleFileSystemDriver");
  return Status;
}
