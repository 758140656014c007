// Action G: the update catalog is fetched from the mounted share into ramfs:.
// The compressed catalog is preferred; the directory it was found in and its
// kind are remembered in the provisioning variables for the later actions.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ProvisioningVars.h"
#include "ShellCommand.h"
#include "Tasks.h"
#include "tasks/TaskSupport.h"

namespace {

constexpr const CHAR8 *kCatalogXml = "catalog.xml";
constexpr const CHAR8 *kCatalogXmlGz = "catalog.xml.gz";
constexpr const CHAR8 *kRamfsVolume = "ramfs:";
constexpr const CHAR8 *kSeparator = "\\";

// The places searched when no directory is given, in order. The share's root
// is the identifier followed by ":" alone.
constexpr const CHAR16 *kDefaultDirectories[] = {nullptr, u"catalog", u"repository"};

const CHAR8 *CatalogFileName(UINT32 Kind) {
  return Kind == CATALOG_KIND_XML ? kCatalogXml : kCatalogXmlGz;
}

// Completion for a catalog found: copy it, then remember where and what. A
// copy that fails leaves the remembered directory and kind as they were.
EFI_STATUS CompleteCatalog(const CHAR8 *Directory, UINT32 ShareType, UINT32 Kind) {
  EFI_STATUS Status = GetCatalogToRamfs(Directory, CatalogFileName(Kind));
  if (!EFI_ERROR(Status)) {
    PersistCatalogPath(Directory, ShareType);
    SetCatalogKind(Kind);
  }
  return Status;
}

// Tries the compressed catalog, then the plain one, in SearchPath. A catalog
// found is completed (copied, then persisted). Anything but EFI_NOT_FOUND
// means the catalog was there: its copy has decided and the search ends.
EFI_STATUS SearchCatalog(const CHAR16 *SearchPath, UINT32 ShareType, bool AnnounceFound) {
  CHAR8 *Directory = UnicodeStrDupToAscii(SearchPath);
  if (Directory == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n failed to allocate memory for mbsCatalogPath");
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_ALWAYS, "\nmbsCatalogPath = %a", Directory);
  UINT32 Kind = CATALOG_KIND_XML_GZ;
  EFI_STATUS Status = CheckCatalogLocation(Directory, Kind);
  if (Status == EFI_NOT_FOUND) {
    Kind = CATALOG_KIND_XML;
    Status = CheckCatalogLocation(Directory, Kind);
  }
  if (!EFI_ERROR(Status)) {
    if (AnnounceFound) {
      DiagLog(DIAG_ALWAYS, "\nfound catalog file");
    }
    Status = CompleteCatalog(Directory, ShareType, Kind);
    if (Status == EFI_NOT_FOUND) {
      Status = EFI_DEVICE_ERROR; // found a moment ago: the copy failed
    }
  }
  FreePool(Directory);
  return Status;
}

CHAR16 *BuildSearchPath(const CHAR16 *Identifier, const CHAR16 *Directory, bool Root) {
  const CHAR16 *Parts[] = {Identifier, Root ? u":" : u":\\", Directory};
  CHAR16 *Path = JoinText(Parts);
  if (Path == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n failed to allocate memory for catalogPath");
  }
  return Path;
}

} // namespace

EFI_STATUS GetCatalogFromNwFS(UINT32 ShareType, const CHAR16 *CatalogDir, BOOLEAN RootOnly) {
  DiagLog(DIAG_ALWAYS, "entering in to GetCatalogFromNwFS()\n");
  UINT32 Kind = CATALOG_KIND_NONE;
  ResetCatalogEnvVar(&Kind);

  const CHAR16 *Identifier = ShareVolumeIdentifier(ShareType);
  CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1];
  EFI_STATUS Status = EFI_SUCCESS;
  if (!MapShareUnderIdentifier(Identifier, SHARE_MAPPING_STYLE{}, DriveName, &Status)) {
    return Status;
  }

  bool DirectoryGiven = CatalogDir != nullptr && CatalogDir[0] != 0;
  if (DirectoryGiven || RootOnly) {
    CHAR16 *SearchPath = BuildSearchPath(Identifier, RootOnly ? nullptr : CatalogDir, false);
    if (SearchPath == nullptr) {
      return EFI_OUT_OF_RESOURCES;
    }
    DiagLog(DIAG_ALWAYS, "\ncatalogPath = %ls", SearchPath);
    Status = SearchCatalog(SearchPath, ShareType, false);
    FreePool(SearchPath);
    return Status;
  }

  Status = EFI_NOT_FOUND;
  for (const CHAR16 *Directory : kDefaultDirectories) {
    CHAR16 *SearchPath = BuildSearchPath(Identifier, Directory, Directory == nullptr);
    if (SearchPath == nullptr) {
      return EFI_OUT_OF_RESOURCES;
    }
    DiagLogW(DIAG_ALWAYS, u"\ncatalogPath = %s", SearchPath);
    Status = SearchCatalog(SearchPath, ShareType, true);
    FreePool(SearchPath);
    if (Status != EFI_NOT_FOUND) {
      break; // found, whether its copy worked or not
    }
  }
  return Status;
}

EFI_STATUS CheckCatalogLocation(CHAR8 *Directory, UINT32 Kind) {
  if (Directory == nullptr) {
    return EFI_NOT_FOUND;
  }
  const CHAR8 *FileName = CatalogFileName(Kind);
  UINTN Length = AsciiStrLen(Directory);
  if (Length > 0 && (Directory[Length - 1] == '\\' || Directory[Length - 1] == '/')) {
    Directory[Length - 1] = 0;
  }
  const CHAR8 *Parts[] = {Directory, kSeparator, FileName};
  CHAR8 *FilePath = JoinAscii(Parts);
  if (FilePath == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n unable to allocate memory for catalogFilePath");
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_ALWAYS, "\n catalogFilePath = %a", FilePath);
  EFI_STATUS Status = EFI_SUCCESS;
  if (!ShellFileOpensAscii(FilePath)) {
    Status = GetCatalogToRamfs(Directory, FileName);
  }
  if (!EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "\nfound catalog location is %a", FilePath);
  }
  FreePool(FilePath);
  return Status;
}

EFI_STATUS GetCatalogToRamfs(const CHAR8 *Directory, const CHAR8 *FileName) {
  DiagLog(DIAG_ALWAYS, "\nEntering into GetCatalogToRamfs() function\n");
  const CHAR8 *CopyParts[] = {"cp -q ", Directory,    kSeparator, FileName,
                              " ",      kRamfsVolume, kSeparator};
  CHAR8 *Command = JoinAscii(CopyParts);
  if (Command == nullptr) {
    DiagLog(DIAG_ALWAYS, "Error in memory allocation for TempExecCommand in "
                         "GetCatalogFromLocalRepToRAMFS() \n");
    return EFI_OUT_OF_RESOURCES;
  }
  const CHAR8 *SourceParts[] = {Directory, kSeparator, FileName};
  const CHAR8 *CheckParts[] = {kRamfsVolume, kSeparator, FileName};
  CHAR8 *Source = JoinAscii(SourceParts);
  CHAR8 *CatalogFilePath = JoinAscii(CheckParts);
  if (Source == nullptr || CatalogFilePath == nullptr) {
    DiagLog(DIAG_ALWAYS, "Error in memory allocation for CatalogFilePath in "
                         "GetCatalogFromLocalRepToRAMFS() \n");
    FreePool(CatalogFilePath);
    FreePool(Source);
    FreePool(Command);
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_ALWAYS, "\n CatalogFilePath = %a", CatalogFilePath);
  EFI_STATUS Status = RunConfirmedCopy(Command, Source, CatalogFilePath);
  FreePool(CatalogFilePath);
  FreePool(Source);
  FreePool(Command);
  DiagLog(DIAG_ALWAYS, "Exiting from GetCatalogToRamfs() function\n");
  return Status;
}

void DeleteCatalogFromRAMFS(const CHAR8 *FileName) {
  DiagLog(DIAG_ALWAYS, "Entering into DeleteCatalogFromRAMFS() function\n");
  const CHAR8 *Parts[] = {"del -q ", kRamfsVolume, kSeparator, FileName};
  CHAR8 *Command = JoinAscii(Parts);
  if (Command != nullptr) {
    RunSystemCommand(Command);
    FreePool(Command);
  }
  DiagLog(DIAG_ALWAYS, "Exiting from DeleteCatalogFromRAMFS() function\n");
}

void PersistCatalogPath(const CHAR8 *Directory, UINT32 ShareType) {
  PU_PROVISIONING_RECORD Record;
  if (GetPUProvisioningEnvVar(&Record) == nullptr) {
    DiagLog(DIAG_ALWAYS, "Error retrieving PU Environment Variable \n");
    return;
  }
  CHAR8 *Field = nullptr;
  const CHAR8 *Kind = nullptr;
  if (ShareType == NWFS_SHARE_TYPE_CIFS) {
    Field = Record.CifsCatalogPath;
    Kind = "CIFS";
  } else if (ShareType == NWFS_SHARE_TYPE_NFS) {
    Field = Record.NfsCatalogPath;
    Kind = "NFS";
  }
  if (Field != nullptr) {
    const CHAR8 *Text = Directory != nullptr ? Directory : "";
    if (AsciiStrLen(Text) >= PROVISIONING_TEXT_BYTES) {
      DiagLog(DIAG_ALWAYS,
              "Warning: %a catalog path too long. Unable to persist to the PU Env. Variable\n",
              Kind);
    } else {
      AsciiStrCpyS(Field, PROVISIONING_TEXT_BYTES, Text);
    }
  }
  EFI_STATUS Status = SetPUProvisioningEnvVar(&Record);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Setting PU Environment Variable, Status = %X\n",
            static_cast<UINT32>(Status));
  }
}

void SetCatalogKind(UINT32 Kind) {
  UINT32 Value = 0;
  if (GetCatalogEnvVar(&Value) == nullptr) {
    DiagLog(DIAG_ALWAYS, "Error retrieving catalog File Environment Variable \n");
    return;
  }
  Value = Kind;
  EFI_STATUS Status = SetCatalogEnvVar(&Value);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Setting catalog File Environment Variable, Status = %X\n",
            static_cast<UINT32>(Status));
  }
}
