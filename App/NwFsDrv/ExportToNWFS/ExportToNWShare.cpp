// The export half of the trade action: which export the source type asks for,
// the shell name of the mounted share, the destination directory on it, and
// the hand-over to the export task.
#include "ExportToNWFS/ExportTasks.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ShellCommand.h"
#include "Tasks.h"

namespace {

struct EXPORT_SOURCE {
  const CHAR16 *SourceType;
  UINT32 Kind;
};
// Compared whole. "DGR" is compared by its prefix only, deliberately: any
// text that begins with it is a technical-support export.
constexpr EXPORT_SOURCE kExportSources[] = {
    {u"VML", EXPORT_KIND_LOG},
    {u"HWI", EXPORT_KIND_HW_INVENTORY},
    {u"ASI", EXPORT_KIND_SW_INVENTORY},
    {u"BKP", EXPORT_KIND_BACKUP},
};
constexpr const CHAR16 *kTechSupportPrefix = u"DGR";

constexpr const CHAR16 *kVolumeRoot = u":\\";
constexpr const CHAR16 *kSeparator = u"\\";

// A share without a drive name is not found; a map command that cannot be
// allocated ends the export with nothing exported, as a success.
constexpr SHARE_MAPPING_STYLE kExportMapping = {
    .NoDriveText = "Drive name not found!\n",
    .NoDriveStatus = EFI_NOT_FOUND,
    .NoMemoryStatus = EFI_SUCCESS,
    .FailureText = u"ExportToNetworkDevice(): command failed, %s\n",
};

// Steps 7 and 8: the destination directory on the share. Null when it cannot
// be allocated.
CHAR16 *BuildDestination(UINT32 ShareType, const CHAR16 *DriveName, const CHAR16 *FileName) {
  UINTN Length = StrLen(DriveName) + StrLen(kVolumeRoot);
  if (FileName != nullptr) {
    Length += StrLen(FileName) + StrLen(kSeparator);
  }
  UINTN Chars = Length + 5;
  CHAR16 *Destination = static_cast<CHAR16 *>(AllocateZeroPool(Chars * sizeof(CHAR16)));
  if (Destination == nullptr) {
    DiagLog(DIAG_ALWAYS, "\nError allocating memory for BaseLocation in "
                         "Pubusinesslogic_GetKUPLocation.. \n");
    return nullptr;
  }
  if (FileName == nullptr || ShareType == NWFS_SHARE_TYPE_NFS) {
    // An NFS share deliberately exports to its root whatever name is given.
    StrCatS(Destination, Chars, DriveName);
    StrCatS(Destination, Chars, kVolumeRoot);
    DiagLogW(DIAG_ALWAYS, u"DestPath %s \n", Destination);
  } else if (ShareType == NWFS_SHARE_TYPE_CIFS) {
    StrCatS(Destination, Chars, DriveName);
    StrCatS(Destination, Chars, kVolumeRoot);
    StrCatS(Destination, Chars, FileName);
    StrCatS(Destination, Chars, kSeparator);
    DiagLogW(DIAG_ALWAYS, u"destpath = %s", Destination);
  }
  return Destination;
}

EFI_STATUS RunExportTask(UINT32 Kind, const CHAR16 *Destination, UINT32 ShareType) {
  switch (Kind) {
  case EXPORT_KIND_BACKUP:
    return ExportBkpImgFile(Kind, Destination, ShareType);
  case EXPORT_KIND_TECH_SUPPORT:
    return ExportTechSupportFileToNWShare(Kind, Destination, ShareType);
  default:
    return ExportFile(Kind, Destination, ShareType);
  }
}

} // namespace

UINT32 ClassifyExportSource(const CHAR16 *SourceType) {
  if (SourceType == nullptr) {
    return EXPORT_KIND_NONE;
  }
  for (const EXPORT_SOURCE &Source : kExportSources) {
    if (StrCmp(SourceType, Source.SourceType) == 0) {
      return Source.Kind;
    }
  }
  if (StrnCmp(SourceType, kTechSupportPrefix, StrLen(kTechSupportPrefix)) == 0) {
    return EXPORT_KIND_TECH_SUPPORT;
  }
  return EXPORT_KIND_NONE;
}

EFI_STATUS ExporttoNWShare(UINT32 ShareType, const CHAR16 *FileName, const CHAR16 *,
                           const CHAR16 *SourceType) {
  DiagLogW(DIAG_ALWAYS, u"entering in to ExporttoNWShare()\n");
  const CHAR16 *ShareTypeName = ShareVolumeIdentifier(ShareType);
  UINT32 Kind = ClassifyExportSource(SourceType);
  if (Kind == EXPORT_KIND_NONE) {
    DiagLogW(DIAG_ALWAYS, u"\nInvalid: Sourcetype");
    return EFI_INVALID_PARAMETER;
  }

  EFI_STATUS Status = EFI_SUCCESS;
  CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1];
  if (MapShareUnderIdentifier(ShareTypeName, kExportMapping, DriveName, &Status)) {
    CHAR16 *Destination = BuildDestination(ShareType, DriveName, FileName);
    if (Destination == nullptr) {
      Status = EFI_OUT_OF_RESOURCES;
    } else {
      Status = RunExportTask(Kind, Destination, ShareType);
      DiagLog(DIAG_TRACE, "Exiting from ExporttoNWShare()\n");
      FreePool(Destination);
    }
  } else if (DriveName[0] == 0) {
    DiagLog(DIAG_TRACE, "Exiting from ExporttoNWShare()\n");
  }
  DiagExit(Status, DiagChannel::Driver, "ExporttoNWShare");
  return Status;
}
