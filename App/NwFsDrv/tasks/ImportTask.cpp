// Actions I and "e ... Import": one file is copied from the mounted share into
// ramfs:. Action S: the catalog's signature file is copied from the catalog
// directory that action G remembered.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ProvisioningVars.h"
#include "ShellCommand.h"
#include "Tasks.h"
#include "tasks/TaskSupport.h"

namespace {

constexpr const CHAR8 *kSignatureFileName = "catalog.xml.gz.sign";

void PrintCopyCommand(const CHAR16 *Identifier, const CHAR16 *FilePath, const CHAR16 *DestPath,
                      const CHAR16 *Command, UINT32 Line = __builtin_LINE()) {
  DiagLog(DIAG_ALWAYS, "\n NWPartitions = [%ls]\n", Identifier);
  DiagLog(DIAG_ALWAYS, "\n filePath = [%ls]\n", FilePath);
  DiagLog(DIAG_ALWAYS, "\n destFilePath = [%ls]\n", DestPath);
  DiagLog(DIAG_ALWAYS, "\n (%d)command = [%ls]\n", Line, Command);
}

void ReplaceForwardSlashes(CHAR16 *Text) {
  for (; *Text != 0; Text++) {
    if (*Text == u'/') {
      *Text = u'\\';
    }
  }
}

// The name a file path's file has: what follows its last separator.
const CHAR16 *LastComponent(const CHAR16 *Path) {
  const CHAR16 *Name = Path;
  for (const CHAR16 *At = Path; *At != 0; At++) {
    if (*At == u'\\' || *At == u'/') {
      Name = At + 1;
    }
  }
  return Name;
}

// One copy attempt: true when the check path opens afterwards, which ends
// the attempts. *CommandStatus is the runner's result when it could not
// launch the command, else the command's own status. Whether the copy
// counts is decided afterwards, from the sizes.
bool AttemptCopy(const CHAR16 *Command, const CHAR16 *CheckPath, EFI_STATUS *CommandStatus) {
  INTN RunnerResult = RunShellCommand(Command);
  *CommandStatus = RunnerResult != 0 ? static_cast<EFI_STATUS>(RunnerResult) : gLastCommandStatus;
  return ShellFileOpens(CheckPath);
}

// The import echoes the map command and reports a failed one with its status.
constexpr SHARE_MAPPING_STYLE kImportMapping = {
    .CommandText = "\n 1 .)command = [%ls]\n",
    .FailureText = u"GetFileFromNWFS(): command failed, %s\n",
    .FailureStatusLine = true,
};

} // namespace

EFI_STATUS GetFileFromNWFS(UINT32 ShareType, const CHAR16 *FilePath, const CHAR16 *DestPath) {
  DiagEntry(DiagChannel::Driver, "GetFileFromNWFS");
  if (FilePath == nullptr || DestPath == nullptr) {
    DiagError("\nImport file path is NULL!", EFI_NOT_FOUND, "GetFileFromNWFS");
    return EFI_NOT_FOUND;
  }
  const CHAR16 *Identifier = ShareVolumeIdentifier(ShareType);
  EFI_STATUS Status = EFI_SUCCESS;
  CHAR16 DriveName[NWFS_DRIVE_NAME_CHARS + 1];
  if (!MapShareUnderIdentifier(Identifier, kImportMapping, DriveName, &Status)) {
    return Status;
  }

  const CHAR16 *CopyParts[] = {u"cp -q ", Identifier, u":\\", FilePath, u" ", DestPath};
  CHAR16 *Command = JoinText(CopyParts);
  if (Command == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation error for Command \n");
    return EFI_OUT_OF_RESOURCES;
  }
  PrintCopyCommand(Identifier, FilePath, DestPath, Command);

  // The check keeps the file path's directories: it finds the copy only when
  // they exist under the destination too. The copy itself lands under the
  // file's own name in the destination, and must bring as many bytes as the
  // file has on the share.
  const CHAR16 *CheckParts[] = {DestPath, FilePath};
  CHAR16 *CheckPath = JoinText(CheckParts);
  CHAR8 *CheckPath8 = CheckPath != nullptr ? UnicodeStrDupToAscii(CheckPath) : nullptr;
  const CHAR16 *SourceParts[] = {Identifier, u":\\", FilePath};
  CHAR16 *Source = JoinText(SourceParts);
  const CHAR16 *TargetParts[] = {DestPath, LastComponent(FilePath)};
  CHAR16 *Target = JoinText(TargetParts);
  if (CheckPath8 == nullptr || Source == nullptr || Target == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n Memory allocation error for Command \n");
    FreePool(Target);
    FreePool(Source);
    FreePool(CheckPath8);
    FreePool(CheckPath);
    FreePool(Command);
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_ALWAYS, "\n (%d)fileCheck = [%ls]\n", __LINE__, CheckPath);
  DiagLog(DIAG_ALWAYS, "\n fileCheck8 = [%s]\n", CheckPath8);

  ReplaceForwardSlashes(Source);
  UINT64 SourceSize = 0;
  bool SourceFound = ShellFileSize(Source, &SourceSize);
  EFI_STATUS CommandStatus = EFI_SUCCESS;
  if (!AttemptCopy(Command, CheckPath, &CommandStatus)) {
    // A path written with '/' that the shell could not resolve: once more
    // with every '/' turned into '\'.
    ReplaceForwardSlashes(Command);
    PrintCopyCommand(Identifier, FilePath, DestPath, Command);
    if (!AttemptCopy(Command, CheckPath, &CommandStatus)) {
      DiagLogW(DIAG_ALWAYS, u"GetFileFromNWFS(): command failed, %s\n", Command);
    }
  }
  Status = ConfirmCopy(SourceFound, SourceSize, CommandStatus, Target);
  PrintCommandStatus(Status);
  FreePool(Target);
  FreePool(Source);
  FreePool(CheckPath8);
  FreePool(CheckPath);
  FreePool(Command);
  return Status;
}

EFI_STATUS CopyCatalogSignatureToRamfs() {
  PU_PROVISIONING_RECORD Record;
  if (GetPUProvisioningEnvVar(&Record) == nullptr) {
    return EFI_SUCCESS; // nothing remembered, nothing to copy
  }
  // The field is NUL-terminated within its 128 bytes once it passed the
  // record's check; terminate it anyway so the join never runs past it.
  Record.CifsCatalogPath[PROVISIONING_TEXT_BYTES - 1] = 0;
  const CHAR8 *Parts[] = {"cp -q ",  Record.CifsCatalogPath, "\\", kSignatureFileName, " ",
                          "ramfs:\\"};
  const CHAR8 *SourceParts[] = {Record.CifsCatalogPath, "\\", kSignatureFileName};
  const CHAR8 *TargetParts[] = {"ramfs:\\", kSignatureFileName};
  CHAR8 *Command = JoinAscii(Parts);
  CHAR8 *Source = JoinAscii(SourceParts);
  CHAR8 *Target = JoinAscii(TargetParts);
  EFI_STATUS Status = EFI_OUT_OF_RESOURCES;
  if (Command == nullptr || Source == nullptr || Target == nullptr) {
    DiagLog(DIAG_ALWAYS, "\nfailed to allocate memory for command");
  } else {
    Status = RunConfirmedCopy(Command, Source, Target);
  }
  FreePool(Target);
  FreePool(Source);
  FreePool(Command);
  return Status;
}
