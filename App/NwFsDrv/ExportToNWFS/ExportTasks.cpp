// The three export tasks: the log and the two inventories under names built
// from the asset tag and the current time, the backup image under a name built
// from the service tag and time stamp of ramfs:\sysInfo.xml, and every file of
// the technical-support report under its own name.
//
// The copies write through the network volume, whose write offset is shared
// by the whole run: when one run exports several files, each later file is
// written at the offset where the previous one ended.
#include "ExportToNWFS/ExportTasks.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "ShellCommand.h"
#include "tasks/TaskSupport.h"

namespace {

// What the log and inventory export copies for each kind: the word in the
// exported name and the candidate files, the first one present being taken.
struct EXPORT_CANDIDATE {
  const CHAR16 *Source;
  const CHAR8 *Extension;
};
struct EXPORT_FILE_SET {
  UINT32 Kind;
  const CHAR8 *Word;
  EXPORT_CANDIDATE Candidates[2];
};
constexpr EXPORT_FILE_SET kExportFileSets[] = {
    {EXPORT_KIND_LOG, "VelmorLog", {{EXPORT_LOG_FILE, ".xml"}, {EXPORT_LOG_FILE_GZ, ".xml.gz"}}},
    {EXPORT_KIND_HW_INVENTORY, "HWInventory", {{EXPORT_HW_INVENTORY_FILE, ".xml"}, {}}},
    {EXPORT_KIND_SW_INVENTORY, "SWInventory", {{EXPORT_SW_INVENTORY_FILE, ".xml"}, {}}},
};
constexpr const CHAR8 *kBackupWord = "Backup";
constexpr const CHAR8 *kBackupExtension = ".img";
// Used in the exported names when the platform carries no asset tag.
constexpr const CHAR8 *kUnknownAssetTag = "NoAssetTag";

const EXPORT_FILE_SET *FindFileSet(UINT32 Kind) {
  for (const EXPORT_FILE_SET &Set : kExportFileSets) {
    if (Set.Kind == Kind) {
      return &Set;
    }
  }
  return nullptr;
}

template <typename CharT>
bool IsPlainText(const CharT *Text) {
  if (Text == nullptr || Text[0] == 0) {
    return false;
  }
  for (; *Text != 0; Text++) {
    if (!IsPlainFileNameCharacter(static_cast<UINT32>(*Text))) {
      return false;
    }
  }
  return true;
}

bool ValidDestination(const CHAR16 *DestPath, const CHAR8 *Task) {
  if (DestPath != nullptr && DestPath[0] != 0) {
    return true;
  }
  DiagLog(DIAG_ALWAYS, "%a(): destination path is empty!\n", Task);
  return false;
}

// "cp -q <Source> <DestPath><Name>" through the shell; the copy's own status.
EFI_STATUS CopyToShare(const CHAR8 *Task, const CHAR16 *Source, const CHAR16 *DestPath,
                       const CHAR16 *Name) {
  const CHAR16 *Parts[] = {u"cp -q ", Source, u" ", DestPath, Name};
  CHAR16 *Command = JoinText(Parts);
  if (Command == nullptr) {
    DiagLog(DIAG_ALWAYS, "Memory allocation error for Command \n");
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_ALWAYS, "\n (%d)command = [%ls]\n", __LINE__, Command);
  EFI_STATUS Status = RunSystemCommandW(Command);
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "%a(): command failed, %ls\n", Task, Command);
  }
  FreePool(Command);
  return Status;
}

// Exports Source as "<Tag>_<Word>_D..._T...<Extension>" into DestPath.
EFI_STATUS ExportUnderStampedName(const CHAR8 *Task, const CHAR16 *Source, const CHAR16 *DestPath,
                                  const CHAR8 *Tag, const CHAR8 *Word, const EFI_TIME &Time,
                                  const CHAR8 *Extension) {
  CHAR16 Name[EXPORT_NAME_CHARS];
  EFI_STATUS Status = BuildExportFileName(Tag, Word, Time, Extension, Name, EXPORT_NAME_CHARS);
  if (EFI_ERROR(Status)) {
    DiagError("\nExport file name does not fit!", Status, Task);
    return Status;
  }
  DiagLog(DIAG_ALWAYS, "\n sourceFile = [%ls]\n", Source);
  DiagLog(DIAG_ALWAYS, "\n exportFile = [%ls%ls]\n", DestPath, Name);
  return CopyToShare(Task, Source, DestPath, Name);
}

// ---------------------------------------------------------------------------
// The technical-support report's files
// ---------------------------------------------------------------------------
struct REPORT_FILES {
  CHAR16 *Names[EXPORT_MAX_REPORT_FILES];
  UINTN Count;
};

void FreeReportFiles(REPORT_FILES *Files) {
  for (UINTN Index = 0; Index < Files->Count; Index++) {
    FreePool(Files->Names[Index]);
  }
  Files->Count = 0;
}

// Keeps the names sorted, so that a report always exports in the same order.
EFI_STATUS AddReportFile(REPORT_FILES *Files, const CHAR16 *Name) {
  if (Files->Count == EXPORT_MAX_REPORT_FILES) {
    DiagLog(DIAG_ALWAYS, "Too many files in the report, %ls left out\n", Name);
    return EFI_SUCCESS;
  }
  CHAR16 *Copy = StrDup(Name);
  if (Copy == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  UINTN At = Files->Count;
  while (At > 0 && StrCmp(Files->Names[At - 1], Copy) > 0) {
    Files->Names[At] = Files->Names[At - 1];
    At--;
  }
  Files->Names[At] = Copy;
  Files->Count++;
  return EFI_SUCCESS;
}

// One directory entry, read into a growing buffer. *Size is 0 at the end.
EFI_STATUS ReadDirectoryEntry(EFI_SHELL_PROTOCOL *Shell, SHELL_FILE_HANDLE Directory,
                              EFI_FILE_INFO **Info, UINTN *Capacity, UINTN *Size) {
  *Size = *Capacity;
  EFI_STATUS Status = Shell->ReadFile(Directory, Size, *Info);
  if (Status == EFI_BUFFER_TOO_SMALL && *Size > *Capacity) {
    FreePool(*Info);
    *Capacity = *Size + sizeof(CHAR16);
    *Info = static_cast<EFI_FILE_INFO *>(AllocateZeroPool(*Capacity));
    if (*Info == nullptr) {
      return EFI_OUT_OF_RESOURCES;
    }
    *Size = *Capacity;
    Status = Shell->ReadFile(Directory, Size, *Info);
  }
  return Status;
}

// A directory entry is used only when its record lies within what was read
// and its name ends inside it.
bool EntryIsWellFormed(const EFI_FILE_INFO *Info, UINTN Size) {
  if (Size < SIZE_OF_EFI_FILE_INFO + sizeof(CHAR16) || Info->Size > Size ||
      Info->Size < SIZE_OF_EFI_FILE_INFO + sizeof(CHAR16)) {
    return false;
  }
  UINTN Chars = (Info->Size - SIZE_OF_EFI_FILE_INFO) / sizeof(CHAR16);
  for (UINTN Index = 0; Index < Chars; Index++) {
    if (Info->FileName[Index] == 0) {
      return true;
    }
  }
  return false;
}

EFI_STATUS ListReportFiles(EFI_SHELL_PROTOCOL *Shell, SHELL_FILE_HANDLE Directory,
                           REPORT_FILES *Files) {
  UINTN Capacity = SIZE_OF_EFI_FILE_INFO + 256 * sizeof(CHAR16);
  EFI_FILE_INFO *Info = static_cast<EFI_FILE_INFO *>(AllocateZeroPool(Capacity));
  EFI_STATUS Status = Info != nullptr ? EFI_SUCCESS : EFI_OUT_OF_RESOURCES;
  while (!EFI_ERROR(Status)) {
    UINTN Size = 0;
    Status = ReadDirectoryEntry(Shell, Directory, &Info, &Capacity, &Size);
    if (EFI_ERROR(Status) || Size == 0) {
      break;
    }
    if (!EntryIsWellFormed(Info, Size) || (Info->Attribute & EFI_FILE_DIRECTORY) != 0) {
      continue;
    }
    if (!IsPlainText(Info->FileName)) {
      DiagLog(DIAG_ALWAYS, "Report file %ls has an unusable name, left out\n", Info->FileName);
      continue;
    }
    Status = AddReportFile(Files, Info->FileName);
  }
  FreePool(Info);
  return Status;
}

EFI_STATUS CollectReportFiles(REPORT_FILES *Files) {
  EFI_SHELL_PROTOCOL *Shell = CurrentShell();
  if (Shell == nullptr) {
    return EFI_NOT_FOUND;
  }
  SHELL_FILE_HANDLE Directory = nullptr;
  EFI_STATUS Status =
      Shell->OpenFileByName(EXPORT_TECH_SUPPORT_DIR, &Directory, EFI_FILE_MODE_READ);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = ListReportFiles(Shell, Directory, Files);
  Shell->CloseFile(Directory);
  return Status;
}

} // namespace

bool IsPlainFileNameCharacter(UINT32 Character) {
  return (Character >= 'a' && Character <= 'z') || (Character >= 'A' && Character <= 'Z') ||
         (Character >= '0' && Character <= '9') || Character == '.' || Character == '_' ||
         Character == '-';
}

EFI_STATUS BuildExportFileName(const CHAR8 *Tag, const CHAR8 *Word, const EFI_TIME &Time,
                               const CHAR8 *Extension, CHAR16 *Name, UINTN Chars) {
  // Formatted with room to spare, so that a name that had to be cut shows.
  CHAR16 Formatted[EXPORT_NAME_CHARS + 1];
  UINTN Written = UnicodeSPrintAsciiFormat(
      Formatted, EXPORT_NAME_CHARS + 1, "%s_%s_D%04d-%02d-%02d_T%02d-%02d-%02d%s", Tag, Word,
      Time.Year, Time.Month, Time.Day, Time.Hour, Time.Minute, Time.Second, Extension);
  if (Written >= EXPORT_NAME_CHARS || Written >= Chars) {
    return EFI_BUFFER_TOO_SMALL;
  }
  StrCpyS(Name, Chars, Formatted);
  return EFI_SUCCESS;
}

EFI_STATUS ExportFile(UINT32 Kind, const CHAR16 *DestPath, UINT32) {
  DiagLog(DIAG_ALWAYS, "entering in to ExportFile()\n");
  const EXPORT_FILE_SET *Set = FindFileSet(Kind);
  if (Set == nullptr || !ValidDestination(DestPath, "ExportFile")) {
    return EFI_INVALID_PARAMETER;
  }
  const EXPORT_CANDIDATE *Found = nullptr;
  for (const EXPORT_CANDIDATE &Candidate : Set->Candidates) {
    if (Candidate.Source != nullptr && ShellFileOpens(Candidate.Source)) {
      Found = &Candidate;
      break;
    }
  }
  if (Found == nullptr) {
    DiagLog(DIAG_ALWAYS, "\n%a file not found in ramfs!\n", Set->Word);
    return EFI_NOT_FOUND;
  }

  CHAR8 AssetTag[EXPORT_TAG_CHARS];
  if (EFI_ERROR(GetSmbiosAssetTag(AssetTag, sizeof(AssetTag)))) {
    DiagLog(DIAG_ALWAYS, "Asset tag not found in SMBIOS, using %a\n", kUnknownAssetTag);
    AsciiStrCpyS(AssetTag, sizeof(AssetTag), kUnknownAssetTag);
  }
  EFI_TIME Now = {};
  EFI_STATUS Status = gRT->GetTime(&Now, nullptr);
  if (EFI_ERROR(Status)) {
    DiagError("\nGetTime failed!", Status, "ExportFile");
    return Status;
  }
  Status = ExportUnderStampedName("ExportFile", Found->Source, DestPath, AssetTag, Set->Word, Now,
                                  Found->Extension);
  DiagLog(DIAG_TRACE, "Exiting from ExportFile()\n");
  return Status;
}

EFI_STATUS ExportBkpImgFile(UINT32, const CHAR16 *DestPath, UINT32) {
  DiagLog(DIAG_ALWAYS, "entering in to ExportBkpImgFile()\n");
  if (!ValidDestination(DestPath, "ExportBkpImgFile")) {
    return EFI_INVALID_PARAMETER;
  }
  if (!ShellFileOpens(EXPORT_BACKUP_IMAGE_FILE)) {
    DiagLog(DIAG_ALWAYS, "\nBackup image %ls not found!\n", EXPORT_BACKUP_IMAGE_FILE);
    return EFI_NOT_FOUND;
  }
  CHAR8 ServiceTag[EXPORT_TAG_CHARS];
  EFI_TIME Stamp = {};
  EFI_STATUS Status = ReadSysInfo(ServiceTag, sizeof(ServiceTag), &Stamp);
  if (EFI_ERROR(Status)) {
    DiagError("\nReading the service tag and time stamp failed!", Status, "ExportBkpImgFile");
    return Status;
  }
  Status = ExportUnderStampedName("ExportBkpImgFile", EXPORT_BACKUP_IMAGE_FILE, DestPath,
                                  ServiceTag, kBackupWord, Stamp, kBackupExtension);
  DiagLog(DIAG_TRACE, "Exiting from ExportBkpImgFile()\n");
  return Status;
}

EFI_STATUS ExportTechSupportFileToNWShare(UINT32, const CHAR16 *DestPath, UINT32) {
  DiagLog(DIAG_ALWAYS, "entering in to ExportTechSupportFileToNWShare()\n");
  if (!ValidDestination(DestPath, "ExportTechSupportFileToNWShare")) {
    return EFI_INVALID_PARAMETER;
  }
  REPORT_FILES Files = {};
  EFI_STATUS Status = CollectReportFiles(&Files);
  if (!EFI_ERROR(Status) && Files.Count == 0) {
    Status = EFI_NOT_FOUND;
  }
  if (EFI_ERROR(Status)) {
    DiagLog(DIAG_ALWAYS, "\nTechnical support report not found in %ls!\n", EXPORT_TECH_SUPPORT_DIR);
    FreeReportFiles(&Files);
    return Status;
  }
  // Every file is tried; the last failure is the result.
  for (UINTN Index = 0; Index < Files.Count; Index++) {
    const CHAR16 *Parts[] = {EXPORT_TECH_SUPPORT_DIR, u"\\", Files.Names[Index]};
    CHAR16 *Source = JoinText(Parts);
    UINTN Chars = Source != nullptr ? StrLen(Source) + StrLen(DestPath) + 64 : 0;
    CHAR16 *Command =
        Source != nullptr ? static_cast<CHAR16 *>(AllocatePool(Chars * sizeof(CHAR16))) : nullptr;
    EFI_STATUS CopyStatus = EFI_OUT_OF_RESOURCES;
    if (Command == nullptr) {
      DiagLog(DIAG_ALWAYS, "Memory allocation error for Command \n");
    } else {
      UnicodeSPrintAsciiFormat(Command, Chars, "cp -q %ls %ls > ramfs:\\DGRLog.txt", Source,
                               DestPath);
      DiagLog(DIAG_ALWAYS, "\n (%d)command = [%ls]\n", __LINE__, Command);
      CopyStatus = RunSystemCommandW(Command);
      if (EFI_ERROR(CopyStatus)) {
        DiagLog(DIAG_ALWAYS, "ExportTechSupportFileToNWShare(): command failed, %ls\n", Command);
      }
    }
    Status = EFI_ERROR(CopyStatus) ? CopyStatus : Status;
    FreePool(Command);
    FreePool(Source);
  }
  FreeReportFiles(&Files);
  DiagLog(DIAG_TRACE, "Exiting from ExportTechSupportFileToNWShare()\n");
  return Status;
}
