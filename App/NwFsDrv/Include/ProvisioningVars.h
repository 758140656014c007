// The provisioning variables the image shares with other firmware components,
// the start-up initialisation that creates them, the image's copy of the
// shell environment, and the platform-status request over IPMI.
#pragma once

#include "Uefi.h"

// ---------------------------------------------------------------------------
// Variable names, GUIDs and attributes
// ---------------------------------------------------------------------------
constexpr const CHAR16 *PROVISIONING_ENV_VAR_NAME = u"PROVISIONING_ENV_VAR";
constexpr const CHAR16 *PROVISIONING_VOLATILE_VAR_NAME = u"PROVISIONING_ENV_VOLATILE_VAR";
constexpr const CHAR16 *PU_PROVISIONING_VAR_NAME = u"PUPROVISIONING_ENV_VAR";
constexpr const CHAR16 *CATALOG_FILE_VAR_NAME = u"CATALOGFILE_ENV_VAR";

// {4C4AC96B-DD0A-447E-8118-105900DA8629}: the settings record, and the
// outcome record as main and the network library read and write it.
extern const EFI_GUID gProvisioningEnvGuid;
// {7AEEC9D6-45E8-4CDB-8EF1-3099A6002371}: the outcome record as the start-up
// code creates it. The two GUIDs differ deliberately; both are kept.
extern const EFI_GUID gProvisioningVolatileInitGuid;
// {4D4AC77B-DD0A-447E-8117-104901DA8679}
extern const EFI_GUID gPUProvisioningEnvGuid;
// {806E07A4-AE56-11E1-A464-FE1F6188709B}
extern const EFI_GUID gCatalogFileEnvGuid;

constexpr UINT32 PROVISIONING_NV_ATTRIBUTES =
    EFI_VARIABLE_NON_VOLATILE | EFI_VARIABLE_BOOTSERVICE_ACCESS;                     // 3
constexpr UINT32 PROVISIONING_VOLATILE_ATTRIBUTES = EFI_VARIABLE_BOOTSERVICE_ACCESS; // 2

// The vendor's download server, the default host written into both records.
// Configuration: an invented neutral name for this build.
constexpr const CHAR8 *PROVISIONING_DOWNLOAD_HOST = "downloads.provisioning.example";

// ---------------------------------------------------------------------------
// Records
// ---------------------------------------------------------------------------
constexpr UINTN PROVISIONING_TEXT_BYTES = 128;

#pragma pack(push, 1)
// "PROVISIONING_ENV_VAR". The first 140 bytes belong to the record's other
// users and are only zero-filled here.
struct PROVISIONING_ENV_RECORD {
  UINT8 OtherUsers[140];
  CHAR8 DownloadServer[PROVISIONING_TEXT_BYTES];
  CHAR8 SecondText[PROVISIONING_TEXT_BYTES];
};

// "PROVISIONING_ENV_VOLATILE_VAR": the status of the last operation, of which
// main writes only the lowest byte (VerifyStatus); the rest is preserved.
struct PROVISIONING_OUTCOME_RECORD {
  UINT64 OperationStatus;
  UINT8 Preserved[32];
};

// "PUPROVISIONING_ENV_VAR": eight NUL-terminated 8-bit texts.
struct PU_PROVISIONING_RECORD {
  CHAR8 DownloadServer[PROVISIONING_TEXT_BYTES];
  CHAR8 Text1[PROVISIONING_TEXT_BYTES];
  CHAR8 Text2[PROVISIONING_TEXT_BYTES];
  CHAR8 CifsCatalogPath[PROVISIONING_TEXT_BYTES];
  CHAR8 Text4[PROVISIONING_TEXT_BYTES];
  CHAR8 NfsCatalogPath[PROVISIONING_TEXT_BYTES];
  CHAR8 Text6[PROVISIONING_TEXT_BYTES];
  CHAR8 LongText[256];
};
#pragma pack(pop)

static_assert(sizeof(PROVISIONING_ENV_RECORD) == 396, "settings record is 396 bytes");
static_assert(offsetof(PROVISIONING_ENV_RECORD, DownloadServer) == 140, "host field offset");
static_assert(offsetof(PROVISIONING_ENV_RECORD, SecondText) == 268, "second text offset");

static_assert(sizeof(PROVISIONING_OUTCOME_RECORD) == 40, "outcome record is 40 bytes");
static_assert(offsetof(PROVISIONING_OUTCOME_RECORD, Preserved) == 8, "outcome preserved bytes");

static_assert(sizeof(PU_PROVISIONING_RECORD) == 1152, "text-field record is 1152 bytes");
static_assert(offsetof(PU_PROVISIONING_RECORD, Text1) == 128, "text field 1");
static_assert(offsetof(PU_PROVISIONING_RECORD, Text2) == 256, "text field 2");
static_assert(offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath) == 384, "CIFS catalog field");
static_assert(offsetof(PU_PROVISIONING_RECORD, Text4) == 512, "text field 4");
static_assert(offsetof(PU_PROVISIONING_RECORD, NfsCatalogPath) == 640, "NFS catalog field");
static_assert(offsetof(PU_PROVISIONING_RECORD, Text6) == 768, "text field 6");
static_assert(offsetof(PU_PROVISIONING_RECORD, LongText) == 896, "long text field");

// VerifyStatus: the lowest byte of the outcome record's status (the record is
// little-endian on this platform).
inline UINT8 &OutcomeVerifyStatus(PROVISIONING_OUTCOME_RECORD &Record) {
  return reinterpret_cast<UINT8 *>(&Record)[0];
}

// ---------------------------------------------------------------------------
// Start-up initialisation and the image's environment
// ---------------------------------------------------------------------------

// Keeps the tables, locates the shell interfaces, copies the shell's
// environment, finds the IPMI transport and creates missing provisioning
// variables. Returns the status of the outcome record's initialisation.
EFI_STATUS InitializeProvisioningEnv(EFI_HANDLE ImageHandle, EFI_SYSTEM_TABLE *SystemTable);
// Creates the settings record and the outcome record (start-up GUID) when
// they cannot be read. Returns the outcome record's status.
EFI_STATUS InitializeProvisioningVariables();
// Frees everything InitializeProvisioningEnv kept (environment table and the
// mapping list). Safe to call more than once.
void ReleaseProvisioningEnv();

// The image's process environment, filled from the shell's variables.
EFI_STATUS _InitializeEnv();
const CHAR8 *NwGetEnv(const CHAR8 *Name);
EFI_STATUS NwSetEnv(const CHAR8 *Name, const CHAR8 *Value); // overwrites
UINTN NwEnvCount();

// One shell mapping variable: its name with ":" appended and a copy of its
// device path.
struct NWFS_MAP_DEVICE {
  NWFS_MAP_DEVICE *Next;
  CHAR8 *MapName;
  EFI_DEVICE_PATH_PROTOCOL *DevicePath;
  UINTN DevicePathSize;
};
extern NWFS_MAP_DEVICE *gMapDeviceList;

// ---------------------------------------------------------------------------
// Variable access
// ---------------------------------------------------------------------------

// Settings record: Record or null.
PROVISIONING_ENV_RECORD *GetProvisioningEnvVar(PROVISIONING_ENV_RECORD *Record);
EFI_STATUS SetProvisioningEnvVar(const PROVISIONING_ENV_RECORD *Record);

// Text-field record: Record or null. A record with a corrupted field is
// re-initialised with defaults (needs the platform status).
PU_PROVISIONING_RECORD *GetPUProvisioningEnvVar(PU_PROVISIONING_RECORD *Record);
// EFI_INVALID_PARAMETER (nothing written) when a field fails the check.
EFI_STATUS SetPUProvisioningEnvVar(const PU_PROVISIONING_RECORD *Record);

// Catalog flag.
UINT32 *GetCatalogEnvVar(UINT32 *Value);
EFI_STATUS SetCatalogEnvVar(const UINT32 *Value);
EFI_STATUS ResetCatalogEnvVar(UINT32 *Value);

// NVRAM string check: true when the text up to its NUL (at most 128 bytes)
// has no control character. A null text passes. Room bounds how far the
// printed copy of the text may be read (a field's remaining record bytes).
bool IsNvramStringValid(const CHAR8 *Text, UINTN Room = PROVISIONING_TEXT_BYTES);

// ---------------------------------------------------------------------------
// Platform status
// ---------------------------------------------------------------------------

// The IPMI transport from the configuration table, or null.
struct IPMI_TRANSPORT;
extern IPMI_TRANSPORT *gIpmiTransport;
IPMI_TRANSPORT *LocateIpmiTransport(EFI_SYSTEM_TABLE *SystemTable);

constexpr UINT32 PM_STATUS_MAX_ATTEMPTS = 10;
constexpr UINTN PM_STATUS_RETRY_MICROSECONDS = 1000000;

// Asks the management controller for the platform status. FirstStatus gets
// response byte 6, SecondStatus response byte 2. EFI_NOT_FOUND without a
// transport.
EFI_STATUS GetPMStatus(UINT8 *FirstStatus, UINT8 *SecondStatus);
