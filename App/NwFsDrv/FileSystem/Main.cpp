// main: argument check, start-up, debug levels, mount, the action chosen by
// the first letter of argument 1, the outcome record and the unmount.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwFsDrv.h"
#include "ProvisioningVars.h"
#include "Tasks.h"

namespace {

constexpr const CHAR8 *kMainName = "main";
constexpr const CHAR16 *kRamfsRoot = u"ramfs:\\";
constexpr UINT8 kVerifyStatusInProgress = 14;

// Argument slots main keeps UCS-2 copies of.
enum ArgumentSlot : UINT8 {
  SlotShare,
  SlotIpAddress,
  SlotUser,
  SlotPassword,
  SlotFile,
  SlotTradeType,
  SlotSourceType,
  SlotCount
};
constexpr INT8 kNoArgument = -1;
// Where each slot comes from on the command line: the standard layout, and
// the trade layout that only the lower-case actions "e" and "m" select.
constexpr INT8 kStandardLayout[SlotCount] = {2, 3, 4, 5, 6, kNoArgument, kNoArgument};
constexpr INT8 kTradeLayout[SlotCount] = {2, 3, 6, 7, 8, 4, 5};

struct MAIN_ARGUMENTS {
  CHAR16 *Slot[SlotCount];
};

bool SameText(const CHAR16 *Text, const CHAR16 *Keyword) {
  return Text != nullptr && StrCmp(Text, Keyword) == 0;
}

EFI_STATUS CopyArguments(INTN Argc, CHAR8 **Argv, MAIN_ARGUMENTS *Arguments) {
  CHAR8 Action = Argv[1][0];
  const INT8 *Layout = Action == 'e' || Action == 'm' ? kTradeLayout : kStandardLayout;
  for (UINTN Slot = 0; Slot < SlotCount; Slot++) {
    INT8 Index = Layout[Slot];
    if (Index == kNoArgument || Index >= Argc) {
      continue;
    }
    Arguments->Slot[Slot] = AsciiStrDupToUnicode(Argv[Index]);
    if (Arguments->Slot[Slot] == nullptr) {
      DiagLog(DIAG_ALWAYS, "Memory Allocation failed in MountPartition\n");
      return EFI_OUT_OF_RESOURCES;
    }
  }
  return EFI_SUCCESS;
}

// One of the copies is the password: every copy is cleared before it goes.
void FreeArguments(MAIN_ARGUMENTS *Arguments) {
  for (CHAR16 *&Copy : Arguments->Slot) {
    FreeClearedStr(Copy);
    Copy = nullptr;
  }
}

// Without runtime services nothing is read, and the empty size marks the
// read as failed.
EFI_STATUS ReadOutcome(PROVISIONING_OUTCOME_RECORD *Record, UINTN *DataSize) {
  ZeroMem(Record, sizeof(*Record));
  if (gRT == nullptr) {
    *DataSize = 0;
    return EFI_NOT_READY;
  }
  *DataSize = sizeof(*Record);
  return gRT->GetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid, nullptr, DataSize,
                          Record);
}

EFI_STATUS WriteOutcome(const PROVISIONING_OUTCOME_RECORD &Record) {
  if (gRT == nullptr) {
    return EFI_NOT_READY;
  }
  return gRT->SetVariable(PROVISIONING_VOLATILE_VAR_NAME, &gProvisioningEnvGuid,
                          PROVISIONING_VOLATILE_ATTRIBUTES, sizeof(Record), &Record);
}

// Marks the outcome record "in progress" (VerifyStatus 14). Neither result
// changes main's flow.
void MarkOutcomeInProgress() {
  CHAR8 Prefix[48];
  AsciiSPrint(Prefix, sizeof(Prefix), "%s (%d): ", kMainName, __LINE__);
  DiagGuid(DIAG_VERBOSE, Prefix, gProvisioningEnvGuid);
  PROVISIONING_OUTCOME_RECORD Record;
  UINTN DataSize;
  EFI_STATUS Status = ReadOutcome(&Record, &DataSize);
  DiagErrorAt(DiagChannel::Driver, DIAG_VERBOSE, "GetVariable returned", Status, kMainName);
  OutcomeVerifyStatus(Record) = kVerifyStatusInProgress;
  DiagLog(DIAG_VERBOSE, "Getting var.VerifyStatus = %d\n", OutcomeVerifyStatus(Record));
  Status = WriteOutcome(Record);
  DiagErrorAt(DiagChannel::Driver, DIAG_VERBOSE, "SetVariable returned", Status, kMainName);
}

// Writes the action's low status byte into VerifyStatus and returns main's
// status. The variable calls' results are deliberately kept in one byte:
// only an empty read counts as a failure (and its byte becomes main's
// status), and a failed write is never reported.
EFI_STATUS RecordOutcome(EFI_STATUS Status) {
  DiagGuid(DIAG_VERBOSE, nullptr, gProvisioningEnvGuid);
  PROVISIONING_OUTCOME_RECORD Record;
  UINTN DataSize;
  UINT8 VariableStatus = static_cast<UINT8>(ReadOutcome(&Record, &DataSize));
  if (EFI_ERROR(VariableStatus) || DataSize == 0) {
    DiagError("\nGetting PROVISIONING_ENV_VOLATILE_VAR failed", VariableStatus, kMainName);
    return VariableStatus;
  }
  OutcomeVerifyStatus(Record) = static_cast<UINT8>(Status);
  DiagLog(DIAG_VERBOSE, "Getting var.VerifyStatus = %d\n", OutcomeVerifyStatus(Record));
  VariableStatus = static_cast<UINT8>(WriteOutcome(Record));
  if (EFI_ERROR(VariableStatus)) {
    DiagError("\nSetting PROVISIONING_ENV_VOLATILE_VAR failed!", VariableStatus, kMainName);
  }
  return Status;
}

// Copies the (trimmed) import path into ramfs:. The trade branches print
// their own message for a missing path.
EFI_STATUS ImportToRamfs(const CHAR16 *Path, const CHAR8 *MissingMessage) {
  if (Path == nullptr) {
    DiagLog(DIAG_ALWAYS, "%a", MissingMessage);
    return EFI_NOT_FOUND;
  }
  const CHAR16 *Trimmed = TrimVolumePrefix(Path, true);
  return GetFileFromNWFS(NWFS_SHARE_TYPE_CIFS, Trimmed, kRamfsRoot);
}

EFI_STATUS RunTrade(const MAIN_ARGUMENTS &Arguments) {
  const CHAR16 *TradeType = Arguments.Slot[SlotTradeType];
  const CHAR16 *SourceType = Arguments.Slot[SlotSourceType];
  DiagLogW(DIAG_VERBOSE, u"tradeType = %ls\n", TradeType);
  DiagLogW(DIAG_VERBOSE, u"sourceType = %ls\n", SourceType);
  if (SameText(TradeType, u"Export")) {
    return ExporttoNWShare(NWFS_SHARE_TYPE_CIFS, Arguments.Slot[SlotFile], TradeType, SourceType);
  }
  if (!SameText(TradeType, u"Import")) {
    return EFI_SUCCESS;
  }
  if (SameText(SourceType, u"BKP")) {
    return ImportToRamfs(Arguments.Slot[SlotFile], "\nBackup file is NULL!\n");
  }
  if (SameText(SourceType, u"UnattendOsd")) {
    DiagLog(DIAG_VERBOSE, "\n entered in to the filesystem \n");
    return ImportToRamfs(Arguments.Slot[SlotFile], "\nUnattended OS file is NULL!\n");
  }
  return EFI_SUCCESS;
}

EFI_STATUS RunAction(const CHAR8 *Action, const MAIN_ARGUMENTS &Arguments) {
  DiagLog(DIAG_VERBOSE, "selectedAction = %s\n", Action);
  const CHAR16 *FilePath = Arguments.Slot[SlotFile];
  switch (Action[0]) {
  case 'E':
  case 'e':
    return RunTrade(Arguments);
  case 'G':
  case 'g':
    return GetCatalogFromNwFS(
        NWFS_SHARE_TYPE_CIFS, FilePath,
        ComputeCatalogFlag(NWFS_SHARE_TYPE_CIFS, Arguments.Slot[SlotShare]) ? TRUE : FALSE);
  case 'I':
  case 'i':
    if (FilePath == nullptr) {
      DiagError("\nImport file path is NULL!", EFI_NOT_FOUND, kMainName);
      return EFI_NOT_FOUND;
    }
    return GetFileFromNWFS(NWFS_SHARE_TYPE_CIFS, TrimVolumePrefix(FilePath, false), kRamfsRoot);
  case 'S':
  case 's':
    return CopyCatalogSignatureToRamfs();
  default:
    return EFI_SUCCESS; // "m" and anything else: mount and unmount only
  }
}

// Steps 3 to 7: start-up, debug levels, outcome "in progress", the argument
// copies, the mount and the action.
EFI_STATUS StartAndRunAction(INTN Argc, CHAR8 **Argv, MAIN_ARGUMENTS *Arguments) {
  EFI_STATUS Status = InitializeProvisioningEnv(gImageHandle, gST);
  if (Status != EFI_SUCCESS) {
    DiagError("\n IPMI Library not initialized!", Status, kMainName);
    DiagLog(DIAG_VERBOSE, "\n Exiting from NWFS\n");
    return Status;
  }
  DiagLog(DIAG_VERBOSE, "\n IPMI Library initialized \n");

  EFI_STATUS LevelStatus = QVUIkestDebugLevelInitialize(&gDriverDebugLevel);
  if (EFI_ERROR(LevelStatus)) {
    DiagError("Get debuglevel failed!", LevelStatus, kMainName);
  }
  DiagLog(DIAG_ALWAYS, "Debug level is set to %d\n", gDriverDebugLevel);
  LevelStatus = SMB2DebugLevelInitialize(&gSMB2DebugLevel);
  if (EFI_ERROR(LevelStatus)) {
    DiagError("Get SMB2 debuglevel failed!", LevelStatus, kMainName);
  }
  DiagLog(DIAG_ALWAYS, "SMB2 Debug level is set to %d\n", gSMB2DebugLevel);

  MarkOutcomeInProgress();

  Status = CopyArguments(Argc, Argv, Arguments);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = StartMountFileSystem(Arguments->Slot[SlotShare], Arguments->Slot[SlotIpAddress],
                                NWFS_SHARE_TYPE_CIFS, Arguments->Slot[SlotUser],
                                Arguments->Slot[SlotPassword]);
  if (EFI_ERROR(Status)) {
    DiagError("Mount partition failed!", Status, kMainName);
    return Status;
  }
  return RunAction(Argv[1], *Arguments);
}

} // namespace

EFI_STATUS ValidateArguments(INTN Argc, CHAR8 **Argv, INTN Minimum, INTN Maximum) {
  if (Argv == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (Argc < Minimum || Argc > Maximum) {
    DiagLog(DIAG_MISMATCH,
            "Mismatch in number of parameters passed! Min. = %d, Max = %d, Actual = %d\n",
            static_cast<INT32>(Minimum), static_cast<INT32>(Maximum), static_cast<INT32>(Argc));
    for (INTN Index = 0; Index < Argc; Index++) {
      // Each argument is printed twice in a row, deliberately.
      DiagLog(DIAG_VERBOSE, "argv[%d] = %s\n", static_cast<INT32>(Index), Argv[Index]);
      DiagLog(DIAG_VERBOSE, "argv[%d] = %s\n", static_cast<INT32>(Index), Argv[Index]);
    }
    return EFI_UNSUPPORTED;
  }
  EFI_STATUS Status = EFI_SUCCESS;
  for (INTN Index = 1; Index < Argc; Index++) {
    if (Argv[Index] == nullptr) {
      DiagLog(DIAG_ALWAYS, "Parameters %d is NULL\n", static_cast<INT32>(Index));
      return EFI_INVALID_PARAMETER;
    }
    // The last argument examined decides: a valid one after an over-long one
    // passes on purpose.
    if (AsciiStrnLen(Argv[Index], NWFS_MAX_ARGUMENT_LENGTH) >= NWFS_MAX_ARGUMENT_LENGTH) {
      DiagLog(DIAG_ALWAYS, "Invalid Parameters %d\n", static_cast<INT32>(Index));
      Status = EFI_INVALID_PARAMETER;
    } else {
      Status = EFI_SUCCESS;
    }
  }
  return Status;
}

const CHAR16 *TrimVolumePrefix(const CHAR16 *Path, bool TrailingNewline) {
  const CHAR16 *Found = Path != nullptr ? StrStr(Path, u":\\") : nullptr;
  if (Found == nullptr) {
    return Path;
  }
  const CHAR16 *Trimmed = Found + 2;
  DiagLog(DIAG_ALWAYS,
          TrailingNewline ? "\nFound :\\ in the file path\n" : "\nFound :\\ in the file path");
  DiagLog(DIAG_VERBOSE, "\n DupPath = %ls\n", Trimmed);
  return Trimmed;
}

bool ComputeCatalogFlag(UINT32 ShareType, const CHAR16 *ShareName) {
  if (ShareType != NWFS_SHARE_TYPE_NFS || ShareName == nullptr) {
    return false;
  }
  const CHAR16 *Separator = StrStr(ShareName, u"\\");
  if (Separator == nullptr) {
    Separator = StrStr(ShareName, u"/");
  }
  return Separator != nullptr && StrLen(Separator) > 1;
}

namespace App {

INT32 main(INTN Argc, CHAR8 **Argv) {
  EFI_STATUS Status = EFI_SUCCESS;
  bool ArgumentsRejected = false;
  MAIN_ARGUMENTS Arguments = {};
  if (Argc != 1) {
    Status = ValidateArguments(Argc, Argv, NWFS_MIN_ARGUMENTS, NWFS_MAX_ARGUMENTS);
    if (EFI_ERROR(Status)) {
      DiagError("Parameters validation failed!", Status);
      ArgumentsRejected = true;
    } else {
      Status = StartAndRunAction(Argc, Argv, &Arguments);
    }
  }

  // Every path records the outcome and unmounts.
  Status = RecordOutcome(Status);
  EFI_STATUS UnmountStatus =
      UnmountStaticFileSystem(Arguments.Slot[SlotShare], Arguments.Slot[SlotIpAddress]);
  if (EFI_ERROR(UnmountStatus)) {
    DiagError("\nfailed to unmount the share!", UnmountStatus);
  }
  // The unmount decides the exit value, so an action's own failure reaches
  // the caller only through VerifyStatus. A rejected command line is the
  // exception: nothing ran, and the caller must see the refusal.
  if (!ArgumentsRejected || EFI_ERROR(UnmountStatus)) {
    Status = UnmountStatus;
  }
  FreeArguments(&Arguments);
  ReleaseProvisioningEnv();
  return static_cast<INT32>(static_cast<UINT32>(Status));
}

} // namespace App
