// Installing the network volume on a handle and taking it down again.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

EFI_UNICODE_COLLATION_PROTOCOL *gUnicodeCollationInterface = nullptr;

namespace {

constexpr UINTN kLanguageBytes = 9;

// One connection string copy; the failure line names the field.
bool CopyConnectionString(const CHAR16 *Source, CHAR16 **Destination, const CHAR8 *Field) {
  *Destination = StrDup(Source != nullptr ? Source : u"");
  if (*Destination == nullptr) {
    DiagLog(DIAG_ALWAYS, "%s: vi->ConnectionInfo->%s Memory allocation failed! Status = 0x%x\n",
            "DetectInstallVolume", Field, static_cast<UINT32>(EFI_OUT_OF_RESOURCES));
    return false;
  }
  return true;
}

EFI_STATUS FillConnectionInfo(NW_VOLUME *Volume, const CHAR16 *IpAddress, const CHAR16 *UserName,
                              const CHAR16 *Password) {
  auto *Info = static_cast<NW_CONNECTION_PARAMS *>(AllocateZeroPool(sizeof(NW_CONNECTION_PARAMS)));
  if (Info == nullptr) {
    DiagLog(DIAG_ALWAYS, "%s: vi->ConnectionInfo Memory allocation failed! Status = 0x%x\n",
            "DetectInstallVolume", static_cast<UINT32>(EFI_OUT_OF_RESOURCES));
    return EFI_INVALID_PARAMETER;
  }
  Volume->ConnectionInfo = Info;
  if (!CopyConnectionString(IpAddress, &Info->ipAddress, "ipAddress")) {
    return EFI_INVALID_PARAMETER;
  }
  if (Volume->shareInfo != nullptr && Volume->shareInfo->shareType == NW_SHARE_TYPE_NFS) {
    Info->uid = NwParseDecimal(UserName);
    Info->gid = NwParseDecimal(Password);
    return EFI_SUCCESS;
  }
  if (!CopyConnectionString(UserName, &Info->username, "username") ||
      !CopyConnectionString(Password, &Info->password, "password")) {
    return EFI_INVALID_PARAMETER;
  }
  return EFI_SUCCESS;
}

void LinkShare(NW_VOLUME *Volume, NW_SHARE_INFO *ShareInfo) {
  Volume->shareInfo = ShareInfo;
  if (ShareInfo == nullptr || ShareInfo->sharename == nullptr) {
    DiagLog(DIAG_VERBOSE, "%s: shareInfo->sharename is NULL\n", "DetectInstallVolume");
    return;
  }
  DiagLog(DIAG_VERBOSE, "%s: shareInfo->sharename = %ls\n", "DetectInstallVolume",
          ShareInfo->sharename);
  DiagLog(DIAG_VERBOSE, "%s: vi->shareInfo->shareType = %ld\n", "DetectInstallVolume",
          ShareInfo->shareType);
  if (ShareInfo->shareType == NW_SHARE_TYPE_CIFS) {
    StrCpyS(Volume->VolumeID, NW_VOLUME_ID_CHARS, u"CIFS");
  } else if (ShareInfo->shareType == NW_SHARE_TYPE_NFS) {
    StrCpyS(Volume->VolumeID, NW_VOLUME_ID_CHARS, u"NFS");
  } else {
    DiagLog(DIAG_ALWAYS, "%s: Unknown vi->shareInfo->shareType = 0x%ld\n", "DetectInstallVolume",
            ShareInfo->shareType);
  }
  Volume->Valid = 1;
  DiagLog(DIAG_VERBOSE, "%s: vi->VolumeID = %ls, vi->shareInfo->shareType = 0x%ld\n",
          "DetectInstallVolume", Volume->VolumeID, ShareInfo->shareType);
}

} // namespace

UINT32 NwParseDecimal(const CHAR16 *Text) {
  constexpr UINTN kNumberChars = 32;
  if (Text == nullptr) {
    return 0;
  }
  CHAR8 Narrow[kNumberChars];
  UnicodeStrToAsciiS(Text, Narrow, kNumberChars);
  UINT32 Value = static_cast<UINT32>(AsciiStrDecimalToInt(Narrow));
  ZeroMem(Narrow, sizeof(Narrow)); // the text may be a password argument
  return Value;
}

EFI_STATUS DetectInstallVolume(EFI_HANDLE Handle, const CHAR8 *Language, NW_SHARE_INFO *ShareInfo,
                               const CHAR16 *IpAddress, const CHAR16 *UserName,
                               const CHAR16 *Password) {
  DiagShortEntry();
  auto *Volume = static_cast<NW_VOLUME *>(AllocateZeroPool(sizeof(NW_VOLUME)));
  if (Volume == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  Volume->Collation = gUnicodeCollationInterface;
  if (Language != nullptr) {
    CopyMem(Volume->Language, Language, AsciiStrnLen(Language, kLanguageBytes));
  }
  Volume->Sfs.Revision = EFI_SIMPLE_FILE_SYSTEM_PROTOCOL_REVISION;
  Volume->Sfs.OpenVolume = OpenVolume;
  NwListInit(&Volume->OpenFiles);
  NwListInit(&Volume->FileHandles);
  EFI_STATUS Status = gBS->InstallMultipleProtocolInterfaces(
      &Handle, &gEfiSimpleFileSystemProtocolGuid, Volume, static_cast<void *>(nullptr));
  if (EFI_ERROR(Status)) {
    FreePool(Volume);
    DiagLog(DIAG_ALWAYS, "%s: InstallMultipleProtocolInterfaces failed! Status = 0x%x\n",
            "DetectInstallVolume", static_cast<UINT32>(Status));
    return EFI_UNSUPPORTED;
  }
  Volume->Handle = Handle;
  LinkShare(Volume, ShareInfo);
  Status = FillConnectionInfo(Volume, IpAddress, UserName, Password);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  DiagShortExit(EFI_SUCCESS);
  return EFI_SUCCESS;
}

EFI_STATUS RemoveInstalledVolume(NW_VOLUME *Volume) {
  if (Volume == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = gBS->UninstallMultipleProtocolInterfaces(
      Volume->Handle, &gEfiSimpleFileSystemProtocolGuid, Volume, static_cast<void *>(nullptr));
  if (EFI_ERROR(Status)) {
    return Status;
  }
  // Handles still open when the volume goes are freed with it: nothing can
  // reach them through the firmware any more.
  while (Volume->FileHandles.First != nullptr) {
    FreeFileHandle(Volume, NW_LIST_OWNER(Volume->FileHandles.First, NW_FILE_HANDLE, VolumeLink));
  }
  CleanupVolume(Volume, EFI_NO_MEDIA);
  fsFreeMemory(Volume, Volume->VolumeLabel);
  if (Volume->ConnectionInfo != nullptr) {
    FreePool(Volume->ConnectionInfo->ipAddress);
    FreePool(Volume->ConnectionInfo->username);
    FreeClearedStr(Volume->ConnectionInfo->password);
    FreePool(Volume->ConnectionInfo);
  }
  FreePool(Volume->ControllerName);
  FreePool(Volume);
  return EFI_SUCCESS;
}
