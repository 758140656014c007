// The provisioning actions main dispatches to, run against the mounted share.
#pragma once

#include "Uefi.h"

// Action G: fetches catalog.xml.gz or catalog.xml from CatalogDir (or the
// default places on the share) into ramfs:.
EFI_STATUS GetCatalogFromNwFS(UINT32 ShareType, const CHAR16 *CatalogDir, BOOLEAN RootOnly);

// Actions I and "e ... Import": copies FilePath (relative to the share's
// root) into DestPath ("ramfs:\"). May return the command runner's result.
EFI_STATUS GetFileFromNWFS(UINT32 ShareType, const CHAR16 *FilePath, const CHAR16 *DestPath);

// Action S: copies the catalog's signature file from the remembered catalog
// directory into ramfs:.
EFI_STATUS CopyCatalogSignatureToRamfs();

// Action "e ... Export": exports the files SourceType asks for to the share.
EFI_STATUS ExporttoNWShare(UINT32 ShareType, const CHAR16 *FileName, const CHAR16 *TradeType,
                           const CHAR16 *SourceType);
