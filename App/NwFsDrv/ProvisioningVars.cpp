// The provisioning variables: their GUIDs, the creation of missing ones at
// start-up, the NVRAM string check and the get/set operations of the other
// modules.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"

const EFI_GUID gProvisioningEnvGuid = {
    0x4C4AC96B, 0xDD0A, 0x447E, {0x81, 0x18, 0x10, 0x59, 0x00, 0xDA, 0x86, 0x29}};
const EFI_GUID gProvisioningVolatileInitGuid = {
    0x7AEEC9D6, 0x45E8, 0x4CDB, {0x8E, 0xF1, 0x30, 0x99, 0xA6, 0x00, 0x23, 0x71}};
const EFI_GUID gPUProvisioningEnvGuid = {
    0x4D4AC77B, 0xDD0A, 0x447E, {0x81, 0x17, 0x10, 0x49, 0x01, 0xDA, 0x86, 0x79}};
const EFI_GUID gCatalogFileEnvGuid = {
    0x806E07A4, 0xAE56, 0x11E1, {0xA4, 0x64, 0xFE, 0x1F, 0x61, 0x88, 0x70, 0x9B}};

namespace {

// The eight text fields of the text-field record, by offset.
constexpr UINTN kPUFieldOffsets[] = {offsetof(PU_PROVISIONING_RECORD, DownloadServer),
                                     offsetof(PU_PROVISIONING_RECORD, Text1),
                                     offsetof(PU_PROVISIONING_RECORD, Text2),
                                     offsetof(PU_PROVISIONING_RECORD, CifsCatalogPath),
                                     offsetof(PU_PROVISIONING_RECORD, Text4),
                                     offsetof(PU_PROVISIONING_RECORD, NfsCatalogPath),
                                     offsetof(PU_PROVISIONING_RECORD, Text6),
                                     offsetof(PU_PROVISIONING_RECORD, LongText)};

// Bytes 0 to 8 and byte 137 of the settings record are cleared explicitly
// by its creator; the whole record is zero-filled here, which covers them.
void FillSettingsDefaults(PROVISIONING_ENV_RECORD *Record) {
  ZeroMem(Record, sizeof(*Record));
  AsciiStrCpyS(Record->DownloadServer, sizeof(Record->DownloadServer),
               PROVISIONING_DOWNLOAD_HOST); // the second text stays empty
}

EFI_STATUS ReadVariable(const CHAR16 *Name, const EFI_GUID &Guid, void *Buffer, UINTN Size) {
  if (gRT == nullptr) {
    return EFI_NOT_READY;
  }
  UINTN DataSize = Size;
  return gRT->GetVariable(Name, &Guid, nullptr, &DataSize, Buffer);
}

// Sets a variable. A failure is printed with FailureFormat (its one
// conversion takes the status) unless that is null.
EFI_STATUS WriteVariable(const CHAR16 *Name, const EFI_GUID &Guid, UINT32 Attributes,
                         const void *Buffer, UINTN Size, const CHAR8 *FailureFormat) {
  EFI_STATUS Status =
      gRT != nullptr ? gRT->SetVariable(Name, &Guid, Attributes, Size, Buffer) : EFI_NOT_READY;
  if (EFI_ERROR(Status) && FailureFormat != nullptr) {
    DiagLog(DIAG_ALWAYS, FailureFormat, static_cast<UINT32>(Status));
  }
  return Status;
}

bool PUFieldsValid(const PU_PROVISIONING_RECORD *Record) {
  const CHAR8 *Base = reinterpret_cast<const CHAR8 *>(Record);
  for (UINTN Offset : kPUFieldOffsets) {
    if (!IsNvramStringValid(Base + Offset, sizeof(*Record) - Offset)) {
      return false;
    }
  }
  return true;
}

EFI_STATUS InitializeSettingsRecord() {
  PROVISIONING_ENV_RECORD Record;
  if (ReadVariable(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid, &Record, sizeof(Record)) ==
      EFI_SUCCESS) {
    DiagLog(DIAG_ALWAYS, "\nPROVISIONING_ENV_VAR already initialized");
    return EFI_SUCCESS;
  }
  FillSettingsDefaults(&Record);
  return WriteVariable(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                       &Record, sizeof(Record), "\nSetting PROVISIONING_ENV_VAR failed %X \n");
}

EFI_STATUS InitializeOutcomeRecord() {
  PROVISIONING_OUTCOME_RECORD Record;
  EFI_STATUS Status = ReadVariable(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningVolatileInitGuid,
                                   &Record, sizeof(Record));
  if (Status == EFI_SUCCESS) {
    DiagLog(DIAG_ALWAYS, "\nPROVISIONING_ENV_VOLATILE_VAR already initialized");
    return EFI_SUCCESS;
  }
  DiagLog(DIAG_ALWAYS, "\nGetting PROVISIONING_ENV_VOLATILE_VAR failed %X\n",
          static_cast<UINT32>(Status));
  ZeroMem(&Record, sizeof(Record));
  return WriteVariable(PROVISIONING_VOLATILE_VAR_NAME, gProvisioningVolatileInitGuid,
                       PROVISIONING_VOLATILE_ATTRIBUTES, &Record, sizeof(Record),
                       "\nSetting PROVISIONING_ENV_VOLATILE_VAR failed %X");
}

} // namespace

bool IsNvramStringValid(const CHAR8 *Text, UINTN Room) {
  if (Text == nullptr) {
    DiagLog(DIAG_ALWAYS, "Returned Null String\n");
    return true;
  }
  // The printed copy stops at the NUL or at the end of the caller's record.
  DiagLog(DIAG_ALWAYS, "String - %.*s\n", static_cast<int>(AsciiStrnLen(Text, Room)), Text);
  UINTN Limit = Room < PROVISIONING_TEXT_BYTES ? Room : PROVISIONING_TEXT_BYTES;
  for (UINTN Index = 0; Index < Limit && Text[Index] != 0; Index++) {
    UINT8 Byte = static_cast<UINT8>(Text[Index]);
    if (Byte < 32 || Byte == 127) {
      DiagLog(DIAG_ALWAYS, "Corruption in NVRAM\n");
      return false;
    }
  }
  return true;
}

PROVISIONING_ENV_RECORD *GetProvisioningEnvVar(PROVISIONING_ENV_RECORD *Record) {
  if (Record == nullptr) {
    return nullptr;
  }
  ZeroMem(Record, sizeof(*Record));
  EFI_STATUS Status =
      ReadVariable(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid, Record, sizeof(*Record));
  return EFI_ERROR(Status) ? nullptr : Record;
}

EFI_STATUS SetProvisioningEnvVar(const PROVISIONING_ENV_RECORD *Record) {
  if (Record == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  return WriteVariable(PROVISIONING_ENV_VAR_NAME, gProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                       Record, sizeof(*Record), nullptr);
}

PU_PROVISIONING_RECORD *GetPUProvisioningEnvVar(PU_PROVISIONING_RECORD *Record) {
  if (Record == nullptr) {
    return nullptr;
  }
  ZeroMem(Record, sizeof(*Record));
  EFI_STATUS Status =
      ReadVariable(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, Record, sizeof(*Record));
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Getting PUPROVISIONING_ENV_VAR failed %X\n", static_cast<UINT32>(Status));
    return nullptr;
  }
  if (PUFieldsValid(Record)) {
    return Record;
  }
  // A corrupted record is rewritten whole with its defaults; the host field
  // depends on the platform status.
  UINT8 FirstStatus = 0;
  UINT8 SecondStatus = 0;
  Status = GetPMStatus(&FirstStatus, &SecondStatus);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Error on Getting PM Status. Status = 0x%X\n",
            static_cast<UINT32>(Status));
    return nullptr;
  }
  ZeroMem(Record, sizeof(*Record));
  if (FirstStatus == 0) {
    AsciiStrCpyS(Record->DownloadServer, sizeof(Record->DownloadServer),
                 PROVISIONING_DOWNLOAD_HOST);
  }
  Status =
      WriteVariable(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                    Record, sizeof(*Record), "\nSetting PUPROVISIONING_ENV_VAR failed %X");
  if (EFI_ERROR(Status)) {
    return nullptr;
  }
  return Record;
}

EFI_STATUS SetPUProvisioningEnvVar(const PU_PROVISIONING_RECORD *Record) {
  if (Record == nullptr || !PUFieldsValid(Record)) {
    return EFI_INVALID_PARAMETER;
  }
  return WriteVariable(PU_PROVISIONING_VAR_NAME, gPUProvisioningEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                       Record, sizeof(*Record), "Setting PUPROVISIONING_ENV_VAR failed %X\n");
}

UINT32 *GetCatalogEnvVar(UINT32 *Value) {
  if (Value == nullptr) {
    return nullptr;
  }
  EFI_STATUS Status =
      ReadVariable(CATALOG_FILE_VAR_NAME, gCatalogFileEnvGuid, Value, sizeof(*Value));
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "Getting CATALOGFILE_ENV_VAR failed %X\n", static_cast<UINT32>(Status));
    return nullptr;
  }
  return Value;
}

EFI_STATUS SetCatalogEnvVar(const UINT32 *Value) {
  if (Value == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  return WriteVariable(CATALOG_FILE_VAR_NAME, gCatalogFileEnvGuid, PROVISIONING_NV_ATTRIBUTES,
                       Value, sizeof(*Value), "Setting CATALOGFILE_ENV_VAR failed %X\n");
}

EFI_STATUS ResetCatalogEnvVar(UINT32 *Value) {
  DiagLog(DIAG_ALWAYS, "\nentering in to ResetCatalogEnvVar()");
  UINT32 Local = 0;
  UINT32 *Target = Value != nullptr ? Value : &Local;
  *Target = 0;
  EFI_STATUS Status =
      WriteVariable(CATALOG_FILE_VAR_NAME, gCatalogFileEnvGuid, PROVISIONING_NV_ATTRIBUTES, Target,
                    sizeof(*Target), "\nSetting CATALOGFILE_ENV_VAR failed %X");
  DiagLog(DIAG_ALWAYS, "\nexiting from ResetCatalogEnvVar()");
  return Status;
}

EFI_STATUS InitializeProvisioningVariables() {
  if (InitializeSettingsRecord() != EFI_SUCCESS) {
    DiagLog(DIAG_ALWAYS, "\nError in initialization of Provisioning Environment Variable\n");
  }
  EFI_STATUS Status = InitializeOutcomeRecord();
  if (Status != EFI_SUCCESS) {
    DiagLog(DIAG_ALWAYS,
            "\nError in initialization of Provisioning Environment Volatile Variable\n");
  }
  return Status;
}
