// The system configuration table of the hosted environment and the two
// platform tables published in it: a fake IPMI transport that tests can
// script, and SMBIOS structures describing the "machine" (serial number and
// chassis asset tag).
//
// Settings made with HostSetIpmi and HostSetSmbiosAssetTag before
// HostInitialize are published by it; HostShutdown returns them to the
// defaults (no IPMI transport, asset tag "HOSTASSET").
#include "HostCore.h"
#include "IpmiTransport.h"

#include <stdio.h>
#include <string.h>
#include <sys/mman.h>

#include <algorithm>
#include <string>
#include <vector>

namespace {

std::vector<EFI_CONFIGURATION_TABLE> gTables;

void PublishTables() {
  EFI_SYSTEM_TABLE *St = HostSystemTable();
  if (St == nullptr) {
    return;
  }
  St->NumberOfTableEntries = gTables.size();
  St->ConfigurationTable = gTables.empty() ? nullptr : gTables.data();
  HostSystemTableChanged();
}

// ---------------------------------------------------------------------------
// IPMI transport
// ---------------------------------------------------------------------------
HostIpmiConfig gIpmiConfig;
uint32_t gIpmiAttempts = 0;
uint32_t gIpmiRequestCount = 0;
HostIpmiRequest gIpmiLastRequest = {};

EFI_STATUS EFIAPI IpmiSendCommand(IPMI_TRANSPORT *This, UINT8 NetFunction, UINT8, UINT8 Command,
                                  UINT8 *CommandData, UINT32 CommandDataSize, UINT8 *ResponseData,
                                  UINT32 *ResponseDataSize) {
  if (This == nullptr || ResponseDataSize == nullptr ||
      (CommandData == nullptr && CommandDataSize != 0)) {
    return EFI_INVALID_PARAMETER;
  }
  gIpmiRequestCount++;
  gIpmiLastRequest = HostIpmiRequest{NetFunction, Command, {}, CommandDataSize};
  if (CommandDataSize != 0) {
    memcpy(gIpmiLastRequest.Data, CommandData,
           std::min<size_t>(CommandDataSize, sizeof gIpmiLastRequest.Data));
  }
  if (gIpmiAttempts < gIpmiConfig.FailCount) {
    gIpmiAttempts++;
    return gIpmiConfig.SendStatus;
  }
  uint32_t Length = std::min<uint32_t>(gIpmiConfig.ResponseLength, sizeof gIpmiConfig.Response);
  if (*ResponseDataSize < Length) {
    *ResponseDataSize = Length;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (ResponseData == nullptr && Length != 0) {
    return EFI_INVALID_PARAMETER;
  }
  if (Length != 0) {
    memcpy(ResponseData, gIpmiConfig.Response, Length);
  }
  *ResponseDataSize = Length;
  This->CommandCompletionCode = Length != 0 ? gIpmiConfig.Response[0] : 0;
  return EFI_SUCCESS;
}

IPMI_TRANSPORT gIpmiTransport = {1, IpmiSendCommand, 0};

void PublishIpmi() {
  HostInstallConfigurationTable(&gIpmiTransportTableGuid,
                                gIpmiConfig.Enabled ? &gIpmiTransport : nullptr);
}

// ---------------------------------------------------------------------------
// SMBIOS
// ---------------------------------------------------------------------------
#pragma pack(push, 1)
struct SmbiosEntryPoint21 {
  char Anchor[4]; // "_SM_"
  UINT8 Checksum;
  UINT8 Length;
  UINT8 MajorVersion;
  UINT8 MinorVersion;
  UINT16 MaxStructureSize;
  UINT8 EntryPointRevision;
  UINT8 FormattedArea[5];
  char IntermediateAnchor[5]; // "_DMI_"
  UINT8 IntermediateChecksum;
  UINT16 TableLength;
  UINT32 TableAddress;
  UINT16 NumberOfStructures;
  UINT8 BcdRevision;
};
struct SmbiosEntryPoint30 {
  char Anchor[5]; // "_SM3_"
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
struct SmbiosHeader {
  UINT8 Type;
  UINT8 Length;
  UINT16 Handle;
};
struct SmbiosSystemInfo { // type 1
  SmbiosHeader Hdr;
  UINT8 Manufacturer;
  UINT8 ProductName;
  UINT8 Version;
  UINT8 SerialNumber;
  UINT8 Uuid[16];
  UINT8 WakeUpType;
  UINT8 SkuNumber;
  UINT8 Family;
};
struct SmbiosChassisInfo { // type 3
  SmbiosHeader Hdr;
  UINT8 Manufacturer;
  UINT8 Type;
  UINT8 Version;
  UINT8 SerialNumber;
  UINT8 AssetTag;
  UINT8 BootupState;
  UINT8 PowerSupplyState;
  UINT8 ThermalState;
  UINT8 SecurityStatus;
  UINT32 OemDefined;
  UINT8 Height;
  UINT8 NumberOfPowerCords;
  UINT8 ContainedElementCount;
  UINT8 ContainedElementRecordLength;
  UINT8 SkuNumber;
};
#pragma pack(pop)
static_assert(sizeof(SmbiosEntryPoint21) == 0x1F, "SMBIOS 2.1 entry point is 31 bytes");
static_assert(offsetof(SmbiosEntryPoint21, IntermediateAnchor) == 0x10, "_DMI_ anchor offset");
static_assert(offsetof(SmbiosEntryPoint21, TableAddress) == 0x18, "table address offset");
static_assert(sizeof(SmbiosEntryPoint30) == 0x18, "SMBIOS 3.0 entry point is 24 bytes");
static_assert(offsetof(SmbiosEntryPoint30, TableAddress) == 0x10, "64-bit table address offset");
static_assert(sizeof(SmbiosSystemInfo) == 0x1B, "type 1 formatted area (2.4+)");
static_assert(offsetof(SmbiosSystemInfo, SerialNumber) == 7, "type 1 serial number offset");
static_assert(sizeof(SmbiosChassisInfo) == 0x16, "type 3 formatted area (2.7+)");
static_assert(offsetof(SmbiosChassisInfo, AssetTag) == 8, "type 3 asset tag offset");

constexpr UINT8 SmbiosTypeSystem = 1;
constexpr UINT8 SmbiosTypeChassis = 3;
constexpr UINT8 SmbiosTypeEnd = 127;
constexpr UINT8 ChassisRackMount = 0x17;
constexpr UINT8 StateSafe = 3;
constexpr UINT8 SecurityNone = 3;
constexpr UINT8 WakeUpPowerSwitch = 6;
constexpr const char *DefaultAssetTag = "HOSTASSET";
constexpr const char *SystemSerialNumber = "HOSTSVC1";

bool gSmbiosPresent = true;
std::string gAssetTag = DefaultAssetTag;
void *gSmbiosRegion = nullptr; // below 4 GiB: the 2.1 entry point has a 32-bit address
size_t gSmbiosRegionSize = 0;

// One structure: the formatted area, then its strings, each NUL-terminated,
// then one more NUL (two NULs when there are no strings). Empty strings get
// number 0, "no string", as they cannot be stored.
struct Strings {
  std::vector<std::string> Texts;
};

UINT8 AddString(Strings &Set, const std::string &Text) {
  if (Text.empty()) {
    return 0;
  }
  Set.Texts.push_back(Text);
  return static_cast<UINT8>(Set.Texts.size());
}

void AppendStructure(std::vector<UINT8> &Table, const void *Formatted, size_t Size,
                     const Strings &Set, size_t &MaxSize) {
  size_t Start = Table.size();
  const UINT8 *Bytes = static_cast<const UINT8 *>(Formatted);
  Table.insert(Table.end(), Bytes, Bytes + Size);
  for (const std::string &Text : Set.Texts) {
    Table.insert(Table.end(), Text.begin(), Text.end());
    Table.push_back(0);
  }
  if (Set.Texts.empty()) {
    Table.push_back(0);
  }
  Table.push_back(0);
  MaxSize = std::max(MaxSize, Table.size() - Start);
}

std::vector<UINT8> BuildStructureTable(size_t &MaxSize, UINT16 &Count) {
  std::vector<UINT8> Table;
  MaxSize = 0;

  Strings SystemStrings;
  SmbiosSystemInfo System = {};
  System.Hdr = {SmbiosTypeSystem, sizeof System, 0x0100};
  System.Manufacturer = AddString(SystemStrings, "Hosted Environment");
  System.ProductName = AddString(SystemStrings, "CIFSDrv Host Machine");
  System.Version = AddString(SystemStrings, "1.0");
  System.SerialNumber = AddString(SystemStrings, SystemSerialNumber);
  for (UINT8 I = 0; I < 16; I++) {
    System.Uuid[I] = static_cast<UINT8>(0x10 + I);
  }
  System.WakeUpType = WakeUpPowerSwitch;
  System.SkuNumber = AddString(SystemStrings, "HOSTSKU");
  System.Family = AddString(SystemStrings, "Host");
  AppendStructure(Table, &System, sizeof System, SystemStrings, MaxSize);

  Strings ChassisStrings;
  SmbiosChassisInfo Chassis = {};
  Chassis.Hdr = {SmbiosTypeChassis, sizeof Chassis, 0x0300};
  Chassis.Manufacturer = AddString(ChassisStrings, "Hosted Environment");
  Chassis.Type = ChassisRackMount;
  Chassis.Version = AddString(ChassisStrings, "1.0");
  Chassis.SerialNumber = AddString(ChassisStrings, "HOSTCHS1");
  Chassis.AssetTag = AddString(ChassisStrings, gAssetTag);
  Chassis.BootupState = StateSafe;
  Chassis.PowerSupplyState = StateSafe;
  Chassis.ThermalState = StateSafe;
  Chassis.SecurityStatus = SecurityNone;
  AppendStructure(Table, &Chassis, sizeof Chassis, ChassisStrings, MaxSize);

  SmbiosHeader End = {SmbiosTypeEnd, sizeof End, 0x7F00};
  AppendStructure(Table, &End, sizeof End, Strings{}, MaxSize);
  Count = 3;
  return Table;
}

UINT8 Checksum(const void *Data, size_t Size) {
  UINT8 Sum = 0;
  for (size_t I = 0; I < Size; I++) {
    Sum = static_cast<UINT8>(Sum + static_cast<const UINT8 *>(Data)[I]);
  }
  return static_cast<UINT8>(0x100 - Sum);
}

void ReleaseSmbiosRegion() {
  if (gSmbiosRegion != nullptr) {
    munmap(gSmbiosRegion, gSmbiosRegionSize);
    gSmbiosRegion = nullptr;
    gSmbiosRegionSize = 0;
  }
}

void PublishSmbios() {
  HostInstallConfigurationTable(&gEfiSmbiosTableGuid, nullptr);
  HostInstallConfigurationTable(&gEfiSmbios3TableGuid, nullptr);
  ReleaseSmbiosRegion();
  if (!gSmbiosPresent) {
    return;
  }
  size_t MaxSize = 0;
  UINT16 Count = 0;
  std::vector<UINT8> Table = BuildStructureTable(MaxSize, Count);
  size_t Needed = sizeof(SmbiosEntryPoint21) + sizeof(SmbiosEntryPoint30) + Table.size();
  size_t RegionSize = (Needed + 4095) & ~static_cast<size_t>(4095);
  void *Region = mmap(nullptr, RegionSize, PROT_READ | PROT_WRITE,
                      MAP_PRIVATE | MAP_ANONYMOUS | MAP_32BIT, -1, 0);
  if (Region == MAP_FAILED || Table.size() > UINT16_MAX) {
    fprintf(stderr, "host: no memory below 4 GiB for the SMBIOS tables\n");
    return;
  }
  gSmbiosRegion = Region;
  gSmbiosRegionSize = RegionSize;
  auto *Entry21 = static_cast<SmbiosEntryPoint21 *>(Region);
  auto *Entry30 = reinterpret_cast<SmbiosEntryPoint30 *>(Entry21 + 1);
  UINT8 *Structures = reinterpret_cast<UINT8 *>(Entry30 + 1);
  memcpy(Structures, Table.data(), Table.size());
  uintptr_t TableAddress = reinterpret_cast<uintptr_t>(Structures);

  *Entry21 = SmbiosEntryPoint21{};
  memcpy(Entry21->Anchor, "_SM_", 4);
  Entry21->Length = sizeof *Entry21;
  Entry21->MajorVersion = 2;
  Entry21->MinorVersion = 8;
  Entry21->MaxStructureSize = static_cast<UINT16>(MaxSize);
  memcpy(Entry21->IntermediateAnchor, "_DMI_", 5);
  Entry21->TableLength = static_cast<UINT16>(Table.size());
  Entry21->TableAddress = static_cast<UINT32>(TableAddress);
  Entry21->NumberOfStructures = Count;
  Entry21->BcdRevision = 0x28;
  Entry21->IntermediateChecksum = Checksum(Entry21->IntermediateAnchor, 0x0F);
  Entry21->Checksum = Checksum(Entry21, sizeof *Entry21);

  *Entry30 = SmbiosEntryPoint30{};
  memcpy(Entry30->Anchor, "_SM3_", 5);
  Entry30->Length = sizeof *Entry30;
  Entry30->MajorVersion = 3;
  Entry30->MinorVersion = 0;
  Entry30->EntryPointRevision = 1;
  Entry30->TableMaximumSize = static_cast<UINT32>(Table.size());
  Entry30->TableAddress = TableAddress;
  Entry30->Checksum = Checksum(Entry30, sizeof *Entry30);

  HostInstallConfigurationTable(&gEfiSmbiosTableGuid, Entry21);
  HostInstallConfigurationTable(&gEfiSmbios3TableGuid, Entry30);
}

} // namespace

EFI_STATUS EFIAPI HostInstallConfigurationTable(const EFI_GUID *Guid, void *Table) {
  if (Guid == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  auto Entry = std::find_if(gTables.begin(), gTables.end(), [&](const EFI_CONFIGURATION_TABLE &T) {
    return EfiGuidEqual(T.VendorGuid, *Guid);
  });
  if (Entry == gTables.end()) {
    if (Table == nullptr) {
      return EFI_NOT_FOUND;
    }
    gTables.push_back(EFI_CONFIGURATION_TABLE{*Guid, Table});
  } else if (Table == nullptr) {
    gTables.erase(Entry);
  } else {
    Entry->VendorTable = Table;
  }
  PublishTables();
  return EFI_SUCCESS;
}

void HostConfigTablesInstall() {
  PublishIpmi();
  PublishSmbios();
}

void HostConfigTablesUninstall() {
  gTables.clear();
  PublishTables();
  ReleaseSmbiosRegion();
  gIpmiConfig = HostIpmiConfig{};
  gIpmiAttempts = 0;
  gIpmiRequestCount = 0;
  gIpmiLastRequest = HostIpmiRequest{};
  gSmbiosPresent = true;
  gAssetTag = DefaultAssetTag;
}

void HostSetIpmi(const HostIpmiConfig &Config) {
  gIpmiConfig = Config;
  gIpmiAttempts = 0;
  gIpmiRequestCount = 0;
  gIpmiLastRequest = HostIpmiRequest{};
  if (HostSystemTable() != nullptr) {
    PublishIpmi();
  }
}

uint32_t HostIpmiRequestCount() {
  return gIpmiRequestCount;
}

HostIpmiRequest HostIpmiLastRequest() {
  return gIpmiLastRequest;
}

void HostSetSmbiosAssetTag(const char *AssetTag) {
  gSmbiosPresent = AssetTag != nullptr;
  gAssetTag = AssetTag != nullptr ? AssetTag : "";
  if (HostSystemTable() != nullptr) {
    PublishSmbios();
  }
}
