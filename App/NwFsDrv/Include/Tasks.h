// The provisioning actions main dispatches to, run against the mounted share,
// and the pieces of them that the mount and the tests use.
#pragma once

#include "ShellCommand.h"
#include "Uefi.h"

// ---------------------------------------------------------------------------
// The mounted share's shell name
// ---------------------------------------------------------------------------

// The volume identifier of a share type: "CIFS" for 1, "NFS" otherwise. It is
// also the shell name under which the tasks reach the share.
const CHAR16 *ShareVolumeIdentifier(UINT64 ShareType);

// What a caller makes of the mapping below: the callers differ only in the
// lines they print around it and in what ends them. By default nothing more
// is printed, a share without a drive name lets the caller go on, and a map
// command that cannot be built or launched ends it.
struct SHARE_MAPPING_STYLE {
  // Refresh the shell's mappings before the lookup, and report the drive name
  // found ("driveName = ...", "NWPartitions = ...") at the verbose level.
  bool AfterMount = false;
  // Printed, with the empty drive name, when the share has no drive name.
  const CHAR8 *NoDriveText = nullptr;
  // The caller's result when the share has no drive name; an error ends it.
  EFI_STATUS NoDriveStatus = EFI_SUCCESS;
  // The caller's result when the map command cannot be allocated, which
  // always ends it.
  EFI_STATUS NoMemoryStatus = EFI_OUT_OF_RESOURCES;
  // Printed with the map command before it runs.
  const CHAR8 *CommandText = nullptr;
  // Whether a map command the shell could not launch ends the caller, with
  // the runner's result.
  bool FailureEnds = true;
  // Printed (UCS-2 format) with the map command when its failure ends the
  // caller; FailureStatusLine adds the line "\n (<line>)Status = [<status>]".
  const CHAR16 *FailureText = nullptr;
  bool FailureStatusLine = false;
};

// Looks up the shell name of the volume labelled Identifier into DriveName
// and, when that name does not begin with Identifier, maps the volume under
// Identifier as well ("map <Identifier> <DriveName>:", announced with "trying
// to map --> command: ..."). True when the caller goes on; otherwise *Status
// is the caller's result.
bool MapShareUnderIdentifier(const CHAR16 *Identifier, const SHARE_MAPPING_STYLE &Style,
                             CHAR16 (&DriveName)[NWFS_DRIVE_NAME_CHARS + 1], EFI_STATUS *Status);

// ---------------------------------------------------------------------------
// Catalog retrieval (action G)
// ---------------------------------------------------------------------------

// Catalog kinds as "CATALOGFILE_ENV_VAR" records them.
constexpr UINT32 CATALOG_KIND_NONE = 0;
constexpr UINT32 CATALOG_KIND_XML = 1;    // "catalog.xml"
constexpr UINT32 CATALOG_KIND_XML_GZ = 2; // "catalog.xml.gz"

// Fetches catalog.xml.gz or catalog.xml from CatalogDir (relative to the
// share's root) or, without one, from the share's root, "catalog" and
// "repository", into ramfs:, and remembers the directory and the kind. The
// first catalog found ends the search: its copy decides the result, and only
// a copy that arrived whole is remembered.
EFI_STATUS GetCatalogFromNwFS(UINT32 ShareType, const CHAR16 *CatalogDir, BOOLEAN RootOnly);
// Looks for the catalog of the given kind in Directory (8-bit, a trailing
// separator is removed in place) and copies it to ramfs: when it is not
// directly visible.
EFI_STATUS CheckCatalogLocation(CHAR8 *Directory, UINT32 Kind);
// "cp -q <Directory>\<FileName> ramfs:\"; the copy counts only when it holds
// as many bytes as the file on the share (see ConfirmCopy).
EFI_STATUS GetCatalogToRamfs(const CHAR8 *Directory, const CHAR8 *FileName);
// "del -q ramfs:\<FileName>".
void DeleteCatalogFromRAMFS(const CHAR8 *FileName);
// Stores the catalog directory in the share type's field of
// "PUPROVISIONING_ENV_VAR"; 128 characters or more are not stored.
void PersistCatalogPath(const CHAR8 *Directory, UINT32 ShareType);
// Stores the catalog kind in "CATALOGFILE_ENV_VAR".
void SetCatalogKind(UINT32 Kind);

// ---------------------------------------------------------------------------
// Import (actions I and "e ... Import") and signature copy (action S)
// ---------------------------------------------------------------------------

// Copies FilePath (relative to the share's root) into DestPath ("ramfs:\").
// Success only when the copy arrived whole; EFI_NOT_FOUND without the file
// on the share; EFI_DEVICE_ERROR, with the partial copy deleted, otherwise.
EFI_STATUS GetFileFromNWFS(UINT32 ShareType, const CHAR16 *FilePath, const CHAR16 *DestPath);

// Copies catalog.xml.gz.sign from the remembered catalog directory into
// ramfs:, as whole as the import's copy. Success without doing anything when
// the record cannot be read.
EFI_STATUS CopyCatalogSignatureToRamfs();

// ---------------------------------------------------------------------------
// Export (action "e ... Export")
// ---------------------------------------------------------------------------

// Exports the files SourceType asks for to the share.
EFI_STATUS ExporttoNWShare(UINT32 ShareType, const CHAR16 *FileName, const CHAR16 *TradeType,
                           const CHAR16 *SourceType);
