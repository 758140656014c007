// The chassis asset tag from the SMBIOS table: the entry point is found
// through the system configuration table (the 3.x entry point first, then
// the 2.x one), checked (anchors, the length this layout has, checksums),
// and its structure table walked for the first type-3
// structure. The table is firmware data but is read as untrusted: every
// structure, its string set and the string wanted must lie within the length
// the entry point gives.
#include "ExportToNWFS/ExportTasks.h"

#include "DiagLog.h"
#include "NwBaseLib.h"

namespace {

#pragma pack(push, 1)
struct SMBIOS_ENTRY_POINT_2 {
  CHAR8 Anchor[4]; // "_SM_"
  UINT8 Checksum;
  UINT8 Length;
  UINT8 MajorVersion;
  UINT8 MinorVersion;
  UINT16 MaxStructureSize;
  UINT8 EntryPointRevision;
  UINT8 FormattedArea[5];
  CHAR8 IntermediateAnchor[5]; // "_DMI_"
  UINT8 IntermediateChecksum;
  UINT16 TableLength;
  UINT32 TableAddress;
  UINT16 NumberOfStructures;
  UINT8 BcdRevision;
};
struct SMBIOS_ENTRY_POINT_3 {
  CHAR8 Anchor[5]; // "_SM3_"
  UINT8 Checksum;
  UINT8 Length;
  UINT8 MajorVersion;
  UINT8 MinorVersion;
  UINT8 DocRevision;
  UINT8 EntryPointRevision;
  UINT8 Reserved;
  UINT32 TableMaximumSize;
  UINT64 TableAddress;
};
struct SMBIOS_STRUCTURE_HEADER {
  UINT8 Type;
  UINT8 Length;
  UINT16 Handle;
};
#pragma pack(pop)
static_assert(sizeof(SMBIOS_ENTRY_POINT_2) == 0x1F, "2.x entry point is 31 bytes");
static_assert(offsetof(SMBIOS_ENTRY_POINT_2, IntermediateAnchor) == 0x10, "_DMI_ anchor");
static_assert(offsetof(SMBIOS_ENTRY_POINT_2, TableLength) == 0x16, "2.x table length");
static_assert(offsetof(SMBIOS_ENTRY_POINT_2, TableAddress) == 0x18, "2.x table address");
static_assert(sizeof(SMBIOS_ENTRY_POINT_3) == 0x18, "3.x entry point is 24 bytes");
static_assert(offsetof(SMBIOS_ENTRY_POINT_3, TableMaximumSize) == 0x0C, "3.x table size");
static_assert(offsetof(SMBIOS_ENTRY_POINT_3, TableAddress) == 0x10, "3.x table address");
static_assert(sizeof(SMBIOS_STRUCTURE_HEADER) == 4, "structure header is 4 bytes");

constexpr UINT8 kTypeChassis = 3;
constexpr UINT8 kTypeEndOfTable = 127;
constexpr UINTN kChassisAssetTagOffset = 8;
// The intermediate checksum of a 2.x entry point covers its last 15 bytes.
constexpr UINTN kIntermediateBytes = 0x0F;
// Nor structure tables larger than this.
constexpr UINTN kMaxTableBytes = 0x100000;

bool ChecksumIsZero(const UINT8 *Bytes, UINTN Length) {
  UINT8 Sum = 0;
  for (UINTN Index = 0; Index < Length; Index++) {
    Sum = static_cast<UINT8>(Sum + Bytes[Index]);
  }
  return Sum == 0;
}

// The end (exclusive) of the string set that starts at From: the offset just
// past its double NUL. 0 when the set does not end within the table.
UINTN StringSetEnd(const UINT8 *Table, UINTN TableLength, UINTN From) {
  for (UINTN Index = From; Index + 1 < TableLength; Index++) {
    if (Table[Index] == 0 && Table[Index + 1] == 0) {
      return Index + 2;
    }
  }
  return 0;
}

// String Number (1-based) of the set [From, End). Null when absent.
const UINT8 *FindString(const UINT8 *Table, UINTN From, UINTN End, UINT8 Number, UINTN *Length) {
  UINTN At = From;
  for (UINT8 Current = 1; At < End && Table[At] != 0; Current++) {
    UINTN Start = At;
    while (At < End && Table[At] != 0) {
      At++;
    }
    if (Current == Number) {
      *Length = At - Start;
      return Table + Start;
    }
    At++; // past the string's NUL
  }
  return nullptr;
}

// Copies the tag without surrounding blanks; characters that may not go into
// a file name become '_'. Longer tags are cut to the buffer.
EFI_STATUS CopyAssetTag(const UINT8 *Text, UINTN Length, CHAR8 *AssetTag, UINTN Size) {
  while (Length > 0 && Text[0] == ' ') {
    Text++;
    Length--;
  }
  while (Length > 0 && Text[Length - 1] == ' ') {
    Length--;
  }
  if (Length == 0) {
    return EFI_NOT_FOUND;
  }
  UINTN Copied = 0;
  for (; Copied < Length && Copied + 1 < Size; Copied++) {
    AssetTag[Copied] =
        IsPlainFileNameCharacter(Text[Copied]) ? static_cast<CHAR8>(Text[Copied]) : '_';
  }
  AssetTag[Copied] = 0;
  return EFI_SUCCESS;
}

EFI_STATUS AssetTagFromTable(UINT64 Address, UINT64 Length, CHAR8 *AssetTag, UINTN Size) {
  if (Address == 0 || Length == 0 || Length > kMaxTableBytes) {
    DiagLog(DIAG_ALWAYS, "SMBIOS table at 0x%llx with %lld bytes is not usable!\n", Address,
            Length);
    return EFI_COMPROMISED_DATA;
  }
  return SmbiosFindChassisAssetTag(reinterpret_cast<const UINT8 *>(static_cast<UINTN>(Address)),
                                   static_cast<UINTN>(Length), AssetTag, Size);
}

const void *FindConfigurationTable(const EFI_GUID &Guid) {
  if (gST == nullptr || gST->ConfigurationTable == nullptr) {
    return nullptr;
  }
  for (UINTN Index = 0; Index < gST->NumberOfTableEntries; Index++) {
    if (CompareMem(&gST->ConfigurationTable[Index].VendorGuid, &Guid, sizeof(Guid)) == 0) {
      return gST->ConfigurationTable[Index].VendorTable;
    }
  }
  return nullptr;
}

} // namespace

EFI_STATUS SmbiosFindChassisAssetTag(const UINT8 *Table, UINTN TableLength, CHAR8 *AssetTag,
                                     UINTN Size) {
  if (Table == nullptr || AssetTag == nullptr || Size == 0) {
    return EFI_INVALID_PARAMETER;
  }
  AssetTag[0] = 0;
  UINTN At = 0;
  while (At + sizeof(SMBIOS_STRUCTURE_HEADER) <= TableLength) {
    UINT8 Type = Table[At];
    UINT8 Length = Table[At + 1];
    if (Length < sizeof(SMBIOS_STRUCTURE_HEADER) || Length > TableLength - At) {
      DiagLog(DIAG_ALWAYS, "SMBIOS structure at %d has a bad length %d!\n", static_cast<INT32>(At),
              Length);
      return EFI_COMPROMISED_DATA;
    }
    UINTN Strings = At + Length;
    UINTN End = StringSetEnd(Table, TableLength, Strings);
    if (End == 0) {
      DiagLog(DIAG_ALWAYS, "SMBIOS structure at %d has no end within the table!\n",
              static_cast<INT32>(At));
      return EFI_COMPROMISED_DATA;
    }
    if (Type == kTypeChassis) {
      if (Length <= kChassisAssetTagOffset || Table[At + kChassisAssetTagOffset] == 0) {
        return EFI_NOT_FOUND; // this chassis record carries no asset tag
      }
      UINTN TextLength = 0;
      const UINT8 *Text =
          FindString(Table, Strings, End, Table[At + kChassisAssetTagOffset], &TextLength);
      return Text != nullptr ? CopyAssetTag(Text, TextLength, AssetTag, Size) : EFI_NOT_FOUND;
    }
    if (Type == kTypeEndOfTable) {
      break;
    }
    At = End;
  }
  return EFI_NOT_FOUND;
}

EFI_STATUS SmbiosAssetTagFromEntryPoint(const void *EntryPoint, bool Version3, CHAR8 *AssetTag,
                                        UINTN Size) {
  if (EntryPoint == nullptr) {
    return EFI_NOT_FOUND;
  }
  const UINT8 *Bytes = static_cast<const UINT8 *>(EntryPoint);
  if (Version3) {
    const auto *Entry = static_cast<const SMBIOS_ENTRY_POINT_3 *>(EntryPoint);
    if (CompareMem(Entry->Anchor, "_SM3_", sizeof(Entry->Anchor)) != 0 ||
        Entry->Length != sizeof(*Entry) || !ChecksumIsZero(Bytes, sizeof(*Entry))) {
      DiagLog(DIAG_ALWAYS, "SMBIOS 3.x entry point is not valid!\n");
      return EFI_COMPROMISED_DATA;
    }
    return AssetTagFromTable(Entry->TableAddress, Entry->TableMaximumSize, AssetTag, Size);
  }
  const auto *Entry = static_cast<const SMBIOS_ENTRY_POINT_2 *>(EntryPoint);
  if (CompareMem(Entry->Anchor, "_SM_", sizeof(Entry->Anchor)) != 0 ||
      Entry->Length != sizeof(*Entry) || !ChecksumIsZero(Bytes, sizeof(*Entry)) ||
      CompareMem(Entry->IntermediateAnchor, "_DMI_", sizeof(Entry->IntermediateAnchor)) != 0 ||
      !ChecksumIsZero(Bytes + offsetof(SMBIOS_ENTRY_POINT_2, IntermediateAnchor),
                      kIntermediateBytes)) {
    DiagLog(DIAG_ALWAYS, "SMBIOS entry point is not valid!\n");
    return EFI_COMPROMISED_DATA;
  }
  return AssetTagFromTable(Entry->TableAddress, Entry->TableLength, AssetTag, Size);
}

EFI_STATUS GetSmbiosAssetTag(CHAR8 *AssetTag, UINTN Size) {
  if (AssetTag == nullptr || Size == 0) {
    return EFI_INVALID_PARAMETER;
  }
  AssetTag[0] = 0;
  EFI_STATUS Status = SmbiosAssetTagFromEntryPoint(FindConfigurationTable(gEfiSmbios3TableGuid),
                                                   true, AssetTag, Size);
  if (EFI_ERROR(Status)) {
    Status = SmbiosAssetTagFromEntryPoint(FindConfigurationTable(gEfiSmbiosTableGuid), false,
                                          AssetTag, Size);
  }
  DiagLog(DIAG_VERBOSE, "AssetTag = %a\n", AssetTag);
  return Status;
}
