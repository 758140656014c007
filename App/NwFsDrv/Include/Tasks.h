// The provisioning actions main dispatches to, run against the mounted share,
// and the pieces of them that the mount and the tests use.
#pragma once

#include "Uefi.h"

// ---------------------------------------------------------------------------
// The mounted share's shell name
// ---------------------------------------------------------------------------

// The volume identifier of a share type: "CIFS" for 1, "NFS" otherwise. It is
// also the shell name under which the tasks reach the share.
const CHAR16 *ShareVolumeIdentifier(UINT64 ShareType);
// True when DriveName is not empty and does not begin with Identifier: the
// share then has to be mapped under its identifier as well.
bool DriveNeedsIdentifierMapping(const CHAR16 *DriveName, const CHAR16 *Identifier);
// Builds "map <Identifier> <DriveName>:" and prints "trying to map -->
// command: ..."; the caller runs it and frees it. Null, after "Memory
// allocation error for Command", when it cannot be allocated.
CHAR16 *BuildMapCommand(const CHAR16 *Identifier, const CHAR16 *DriveName);

// ---------------------------------------------------------------------------
// Catalog retrieval (action G)
// ---------------------------------------------------------------------------

// Catalog kinds as "CATALOGFILE_ENV_VAR" records them.
constexpr UINT32 CATALOG_KIND_NONE = 0;
constexpr UINT32 CATALOG_KIND_XML = 1;    // "catalog.xml"
constexpr UINT32 CATALOG_KIND_XML_GZ = 2; // "catalog.xml.gz"

// Fetches catalog.xml.gz or catalog.xml from CatalogDir (relative to the
// share's root) or, without one, from the share's root, "catalog" and
// "repository", into ramfs:, and remembers the directory and the kind.
EFI_STATUS GetCatalogFromNwFS(UINT32 ShareType, const CHAR16 *CatalogDir, BOOLEAN RootOnly);
// Looks for the catalog of the given kind in Directory (8-bit, a trailing
// separator is removed in place) and copies it to ramfs: when it is not
// directly visible.
EFI_STATUS CheckCatalogLocation(CHAR8 *Directory, UINT32 Kind);
// "cp -q <Directory>\<FileName> ramfs:\", then checks that the copy exists.
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
// May return the command runner's result as it is.
EFI_STATUS GetFileFromNWFS(UINT32 ShareType, const CHAR16 *FilePath, const CHAR16 *DestPath);

// Copies catalog.xml.gz.sign from the remembered catalog directory into
// ramfs:. Success without doing anything when the record cannot be read.
EFI_STATUS CopyCatalogSignatureToRamfs();

// ---------------------------------------------------------------------------
// Export (action "e ... Export")
// ---------------------------------------------------------------------------

// Exports the files SourceType asks for to the share.
EFI_STATUS ExporttoNWShare(UINT32 ShareType, const CHAR16 *FileName, const CHAR16 *TradeType,
                           const CHAR16 *SourceType);
