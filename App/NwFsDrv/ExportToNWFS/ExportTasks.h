// The export side of the trade action: the classification of the source type,
// the three export tasks, and the two readers they build file names from (the
// SMBIOS asset tag and the service tag and time stamp of ramfs:\sysInfo.xml).
#pragma once

#include "Uefi.h"

// Export kinds chosen from the source type.
constexpr UINT32 EXPORT_KIND_LOG = 0;          // "VML"
constexpr UINT32 EXPORT_KIND_HW_INVENTORY = 3; // "HWI"
constexpr UINT32 EXPORT_KIND_SW_INVENTORY = 5; // "ASI"
constexpr UINT32 EXPORT_KIND_BACKUP = 6;       // "BKP"
constexpr UINT32 EXPORT_KIND_TECH_SUPPORT = 7; // "DGR..."
constexpr UINT32 EXPORT_KIND_NONE = 8;         // rejected source type

// The files the tasks export, all on the RAM disk.
constexpr const CHAR16 *EXPORT_LOG_FILE = u"ramfs:\\VelmorLog.xml";
constexpr const CHAR16 *EXPORT_LOG_FILE_GZ = u"ramfs:\\VelmorLog.xml.gz";
constexpr const CHAR16 *EXPORT_HW_INVENTORY_FILE = u"ramfs:\\HWInventory.xml";
constexpr const CHAR16 *EXPORT_SW_INVENTORY_FILE = u"ramfs:\\SWInventory.xml";
constexpr const CHAR16 *EXPORT_BACKUP_IMAGE_FILE = u"ramfs:\\backup.img";
constexpr const CHAR16 *EXPORT_SYSINFO_FILE = u"ramfs:\\sysInfo.xml";
// The technical-support report: every file directly in this directory.
constexpr const CHAR16 *EXPORT_TECH_SUPPORT_DIR = u"ramfs:\\TSReport";

// Longest asset tag, service tag and exported file name, in characters.
constexpr UINTN EXPORT_TAG_CHARS = 64;
constexpr UINTN EXPORT_NAME_CHARS = 160;
// Files of a technical-support report exported in one run, at most.
constexpr UINTN EXPORT_MAX_REPORT_FILES = 64;
// Largest sysInfo.xml read, in bytes.
constexpr UINTN SYSINFO_MAX_BYTES = 0x10000;

// EXPORT_KIND_NONE when the source type is not one of the accepted ones.
UINT32 ClassifyExportSource(const CHAR16 *SourceType);

// The three tasks, each given the export kind, the destination directory on
// the share (ending in '\') and the share type.
EFI_STATUS ExportFile(UINT32 Kind, const CHAR16 *DestPath, UINT32 ShareType);
EFI_STATUS ExportBkpImgFile(UINT32 Kind, const CHAR16 *DestPath, UINT32 ShareType);
EFI_STATUS ExportTechSupportFileToNWShare(UINT32 Kind, const CHAR16 *DestPath, UINT32 ShareType);

// "<Tag>_<Word>_DYYYY-MM-DD_THH-MM-SS<Extension>" into Name (Chars
// characters). EFI_BUFFER_TOO_SMALL when it does not fit.
EFI_STATUS BuildExportFileName(const CHAR8 *Tag, const CHAR8 *Word, const EFI_TIME &Time,
                               const CHAR8 *Extension, CHAR16 *Name, UINTN Chars);
// True for a letter, a digit, '.', '_' or '-': what may go into a shell
// command line and a file name unquoted.
bool IsPlainFileNameCharacter(UINT32 Character);

// ---------------------------------------------------------------------------
// SMBIOS asset tag
// ---------------------------------------------------------------------------

// The chassis (type 3) asset tag of the SMBIOS table found through the
// configuration table, the 3.x entry point first. Characters that may not go
// into a file name become '_'. EFI_NOT_FOUND without a table or a tag.
EFI_STATUS GetSmbiosAssetTag(CHAR8 *AssetTag, UINTN Size);
// The same from an entry point ("_SM3_" when Version3, else "_SM_"). The
// entry point is checked (anchor, length, checksum) before its table is used.
EFI_STATUS SmbiosAssetTagFromEntryPoint(const void *EntryPoint, bool Version3, CHAR8 *AssetTag,
                                        UINTN Size);
// Walks the structure table (TableLength bytes) for the first type-3
// structure. Every structure and string is bounded by the table.
EFI_STATUS SmbiosFindChassisAssetTag(const UINT8 *Table, UINTN TableLength, CHAR8 *AssetTag,
                                     UINTN Size);

// ---------------------------------------------------------------------------
// sysInfo.xml
// ---------------------------------------------------------------------------

// The text of the one element <Element>...</Element> of Text (Length bytes).
// Strict: the element must appear exactly once, as a plain start tag without
// attributes, directly followed by its end tag after the text; the text must
// not be empty, must fit Value (Size bytes with its terminator) and holds no
// markup, entity or control character; Text holds no NUL byte.
// EFI_NOT_FOUND when the element is absent, EFI_INVALID_PARAMETER when the
// input is malformed, EFI_BUFFER_TOO_SMALL when the text does not fit.
EFI_STATUS XmlReadElement(const CHAR8 *Text, UINTN Length, const CHAR8 *Element, CHAR8 *Value,
                          UINTN Size);
// "YYYY-MM-DDTHH:MM:SS", every field in its range.
EFI_STATUS ParseXmlTimeStamp(const CHAR8 *Text, EFI_TIME *Time);
// Reads ramfs:\sysInfo.xml: <ServiceTag> (letters and digits only) and
// <TimeStamp>.
EFI_STATUS ReadSysInfo(CHAR8 *ServiceTag, UINTN Size, EFI_TIME *Time);
// The same from the file's text, for callers that have it already.
EFI_STATUS ParseSysInfo(const CHAR8 *Text, UINTN Length, CHAR8 *ServiceTag, UINTN Size,
                        EFI_TIME *Time);
