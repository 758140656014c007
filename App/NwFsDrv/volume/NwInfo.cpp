// GetInfo and SetInfo on the network volume for the three published
// information types: file information (refreshed from the share at every
// query), file-system information (the statistics stored at OpenVolume) and
// the volume label (the volume identifier set at install).
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

namespace {

// Room for the name and two terminating characters.
UINTN FileInfoSize(const CHAR16 *Name) {
  return SIZE_OF_EFI_FILE_INFO + 2 * (Name == nullptr ? 0 : StrLen(Name)) + 4;
}

// Characters of Name that are not '.', and the copy without them.
UINTN LabelLength(const CHAR16 *Name) {
  UINTN Length = 0;
  for (; *Name != 0; Name++) {
    Length += *Name != u'.' ? 1 : 0;
  }
  return Length;
}
void CopyWithoutDots(CHAR16 *Destination, const CHAR16 *Name) {
  for (; *Name != 0; Name++) {
    if (*Name != u'.') {
      *Destination++ = *Name;
    }
  }
  *Destination = 0;
}

bool IsRootOfNfs(const NW_OPEN_FILE *OpenFile) {
  const NW_VOLUME *Volume = OpenFile->Volume;
  return OpenFile->ROOTDIR != 0 && Volume->shareInfo != nullptr &&
         Volume->shareInfo->shareType == NW_SHARE_TYPE_NFS;
}

// The remote file's stat under the busy lock. EFI_NOT_FOUND when the record
// has no path on the share.
EFI_STATUS StatRemote(NW_OPEN_FILE *OpenFile, EFI_FILE_INFO *Stat) {
  CHAR16 *Path = nullptr;
  EFI_STATUS Status = FindCurrentLocation(OpenFile, &Path);
  if (EFI_ERROR(Status)) {
    return EFI_NOT_FOUND;
  }
  ZeroMem(Stat, sizeof(*Stat));
  if (!NwAcquireBusyLock()) {
    Status = EFI_ABORTED;
  } else {
    Status = GEE_NWGetFileStat(OpenFile->Volume->shareInfo, Path, Stat);
    NwReleaseBusyLock();
  }
  fsFreeMemory(OpenFile->Volume, Path);
  return Status;
}

void CopyTimes(EFI_FILE_INFO *Info, EFI_TIME Create, EFI_TIME Access, EFI_TIME Modify) {
  Info->CreateTime = Create;
  Info->LastAccessTime = Access;
  Info->ModificationTime = Modify;
}

// The volume-label setter: the identifier takes the new name when it fits.
EFI_STATUS SetVolumeLabel(NW_VOLUME *Volume, UINTN BufferSize, const CHAR16 *Label) {
  UINTN MaxChars = BufferSize / sizeof(CHAR16);
  UINTN Length = StrnLen(Label, MaxChars);
  if (Length == MaxChars || Length >= NW_VOLUME_ID_CHARS) {
    return EFI_INVALID_PARAMETER; // unterminated, or longer than an identifier
  }
  ZeroMem(Volume->VolumeID, sizeof(Volume->VolumeID));
  CopyMem(Volume->VolumeID, Label, Length * sizeof(CHAR16));
  Volume->Valid = 1;
  return EFI_SUCCESS;
}

// "", "." and ".." name the directory the file is in or one above it, never a
// new name for the file: a rename to one of them does nothing.
bool NamesNoEntry(const CHAR16 *Name) {
  return Name[0] == 0 || StrCmp(Name, u".") == 0 || StrCmp(Name, u"..") == 0;
}

bool IsAncestor(const NW_OPEN_FILE *Candidate, const NW_OPEN_FILE *OpenFile) {
  for (const NW_OPEN_FILE *Up = OpenFile->Parent; Up != nullptr; Up = Up->Parent) {
    if (Up == Candidate) {
      return true;
    }
  }
  return false;
}

// Moves Handle from its record to the record of NewName (opened, or created,
// next to it, with no attribute but the directory bit of the old record). The
// rename stays local: the share is not asked to rename. A directory's record
// is never taken over: a name that leads to a directory above the file
// changes nothing, and a file is not renamed onto another directory.
EFI_STATUS RenameLocally(NW_FILE_HANDLE *Handle, const CHAR16 *NewName) {
  NW_OPEN_FILE *Old = Handle->OpenFile;
  NW_FILE_HANDLE Anchor;
  ZeroMem(&Anchor, sizeof(Anchor));
  Anchor.OpenFile = Old->Parent != nullptr ? Old->Parent : Old;
  NW_FILE_HANDLE *Temporary = nullptr;
  EFI_STATUS Status = ProcessOpenFileHandle(
      &Anchor, NewName, &Temporary, EFI_FILE_MODE_CREATE | EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE,
      Old->DirectoryEntry.Attribute & EFI_FILE_DIRECTORY);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  NW_VOLUME *Volume = Old->Volume;
  NW_OPEN_FILE *New = Temporary->OpenFile;
  bool Above = New->ROOTDIR != 0 || IsAncestor(New, Old);
  bool FileOntoDirectory = !NwIsDirectory(Old) && NwIsDirectory(New);
  if (New == Old || Above || FileOntoDirectory) {
    New->HandleCount--;
    FreeFileHandle(Volume, Temporary);
    return FileOntoDirectory && !Above ? EFI_ACCESS_DENIED : EFI_SUCCESS;
  }
  New->DirectoryEntry = Old->DirectoryEntry;
  // The temporary handle's remote file is not used: close it again.
  if (!NwIsDirectory(New) && NwAcquireBusyLock()) {
    GEE_NWFClose(Volume->shareInfo, &Temporary->shareFileInfo);
    NwReleaseBusyLock();
  }
  // The handle keeps its remote file and takes the new path.
  CHAR16 *OldPath = Handle->FullPath;
  Handle->FullPath = Temporary->FullPath;
  Temporary->FullPath = OldPath;
  Handle->shareFileInfo.FileName = Handle->FullPath;
  // The handle moves in as the temporary one moves out: the count stays.
  Handle->OpenFile = New;
  FreeFileHandle(Volume, Temporary);
  if (Old->Parent != nullptr) {
    DiscardDirEntries(Old->Parent);
  }
  if (New->Parent != nullptr) {
    DiscardDirEntries(New->Parent);
  }
  Old->HandleCount--;
  ReleaseOpenFile(Old);
  New->DirectoryEntry.Attribute |= EFI_FILE_ARCHIVE;
  return EFI_SUCCESS;
}

EFI_STATUS SetFileInfo(NW_FILE_HANDLE *Handle, UINTN BufferSize, const EFI_FILE_INFO *Info) {
  if (BufferSize < SIZE_OF_EFI_FILE_INFO) {
    return EFI_BAD_BUFFER_SIZE;
  }
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  UINTN NameChars = (BufferSize - SIZE_OF_EFI_FILE_INFO) / sizeof(CHAR16);
  if (StrnLen(Info->FileName, NameChars) == NameChars) {
    return EFI_BAD_BUFFER_SIZE; // the name runs past the buffer
  }
  bool WantsDirectory = (Info->Attribute & EFI_FILE_DIRECTORY) != 0;
  if (WantsDirectory != NwIsDirectory(OpenFile) || OpenFile->ROOTDIR != 0) {
    return EFI_ACCESS_DENIED;
  }
  if ((Info->Attribute & ~EFI_FILE_VALID_ATTR) != 0) {
    return EFI_INVALID_PARAMETER;
  }
  bool SizeChanges = Info->FileSize != OpenFile->DirectoryEntry.FileSize;
  bool NameChanges =
      !NwNamesEqual(Info->FileName, OpenFile->FileName) && !NamesNoEntry(Info->FileName);
  if (NwIsDirectory(OpenFile) && SizeChanges) {
    return EFI_ACCESS_DENIED;
  }
  if (OpenFile->Volume->ReadOnly != 0) {
    return EFI_WRITE_PROTECTED;
  }
  bool ReadOnlyFile = (OpenFile->DirectoryEntry.Attribute & EFI_FILE_READ_ONLY) != 0;
  if ((ReadOnlyFile || Handle->OpenMode == EFI_FILE_MODE_READ) && (SizeChanges || NameChanges)) {
    return EFI_ACCESS_DENIED;
  }
  OpenFile->DirectoryEntry.Attribute = Info->Attribute;
  if (NameChanges) {
    EFI_STATUS Status = RenameLocally(Handle, Info->FileName);
    if (EFI_ERROR(Status)) {
      return Status;
    }
    OpenFile = Handle->OpenFile;
  }
  OpenFile->Deleted = 0;
  // Acknowledged locally by the network library: nothing is sent.
  if (!NwAcquireBusyLock()) {
    return EFI_ABORTED;
  }
  NW_SHARE_INFO *Share = OpenFile->Volume->shareInfo;
  EFI_STATUS Status =
      GEE_NWFSetSize(Share, &Handle->shareFileInfo, static_cast<UINT32>(Info->FileSize));
  GEE_NWFCommit(Share, &Handle->shareFileInfo, 0);
  NwReleaseBusyLock();
  return Status;
}

} // namespace

EFI_STATUS GetFileInfoFromFH(NW_OPEN_FILE *OpenFile, UINTN *BufferSize, void *Buffer) {
  // The root is deliberately reported with an empty name although the record
  // keeps "\": firmware shells find a volume's root by climbing with ".."
  // until the name comes back empty, and ".." on the root opens the root
  // again, so any other name would keep them climbing forever.
  const bool IsRoot = OpenFile->ROOTDIR != 0 ||
                      (OpenFile->FileName != nullptr && NwNamesEqual(OpenFile->FileName, u"\\"));
  const CHAR16 *ReportedName = IsRoot ? u"" : OpenFile->FileName;
  UINTN Needed = FileInfoSize(ReportedName);
  DiagLog(DIAG_VERBOSE, "Pfh->FileName = %ls\n", OpenFile->FileName);
  if (*BufferSize < Needed) {
    *BufferSize = Needed;
    return EFI_BUFFER_TOO_SMALL;
  }
  if (Buffer == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  EFI_FILE_INFO Stat;
  EFI_STATUS Status = StatRemote(OpenFile, &Stat);
  if (Status == EFI_ABORTED) {
    return Status;
  }
  bool HaveStat = !EFI_ERROR(Status);
  NW_DIRECTORY_ENTRY &Entry = OpenFile->DirectoryEntry;
  if (HaveStat) {
    if (!IsRootOfNfs(OpenFile)) {
      Entry.Attribute = Stat.Attribute;
    }
    NW_OPEN_FILE *Parent = OpenFile->Parent;
    if (Parent != nullptr && Parent->ROOTDIR != 0 && NwNamesEqual(OpenFile->FileName, u".")) {
      Parent->DirectoryEntry.Attribute |= Stat.Attribute;
    }
  }
  auto *Info = static_cast<EFI_FILE_INFO *>(Buffer);
  ZeroMem(Info, Needed);
  if (HaveStat && !NwIsDirectory(OpenFile)) {
    Info->FileSize = Stat.FileSize;
    CopyTimes(Info, Stat.CreateTime, Stat.LastAccessTime, Stat.ModificationTime);
  } else {
    // No stat (or a directory): the cached values, and a failed stat is not
    // the caller's concern.
    Info->FileSize = Entry.FileSize;
    CopyTimes(Info, Entry.CreateTime, Entry.LastAccessTime, Entry.ModificationTime);
  }
  Info->PhysicalSize = Info->FileSize;
  Info->Attribute = Entry.Attribute & EFI_FILE_VALID_ATTR;
  if (ReportedName != nullptr) {
    CopyMem(Info->FileName, ReportedName, StrLen(ReportedName) * sizeof(CHAR16));
  }
  *BufferSize = Needed;
  Info->Size = Needed;
  Entry.FileSize = Info->FileSize;
  Entry.PhysicalSize = Info->PhysicalSize;
  DiagLog(DIAG_VERBOSE, "%s: \n", "GetFileInfoFromFH");
  DiagLog(DIAG_VERBOSE, "BufferSize = %ld\n", static_cast<UINT64>(*BufferSize));
  DiagLog(DIAG_VERBOSE, "Pfh->DirectoryEntry.FileSize = %ld\n", Entry.FileSize);
  DiagLog(DIAG_VERBOSE, "Pfh->DirectoryEntry.PhysicalSize = %ld\n", Entry.PhysicalSize);
  DiagLog(DIAG_VERBOSE, "Pfh->DirectoryEntry.Size = %ld\n", Entry.Size);
  DiagLog(DIAG_VERBOSE, "buffer->FileName = %ls\n", Info->FileName);
  // An NFS share reports the time of the query as the modification time.
  EFI_TIME Now;
  if (OpenFile->Volume->shareInfo != nullptr &&
      OpenFile->Volume->shareInfo->shareType == NW_SHARE_TYPE_NFS && gRT != nullptr &&
      !EFI_ERROR(gRT->GetTime(&Now, nullptr))) {
    Info->ModificationTime = Now;
  }
  return EFI_SUCCESS;
}

EFI_STATUS GetVolumeLabel(NW_VOLUME *Volume, UINTN *BufferSize, void *Buffer) {
  auto *Out = static_cast<CHAR16 *>(Buffer);
  if (Volume->Valid != 0) {
    UINTN Needed = 2 * StrnLen(Volume->VolumeID, NW_VOLUME_ID_CHARS - 1) + 2;
    if (*BufferSize < Needed || Out == nullptr) {
      *BufferSize = Needed;
      return EFI_BUFFER_TOO_SMALL;
    }
    CopyMem(Out, Volume->VolumeID, Needed - 2);
    Out[Needed / 2 - 1] = 0;
    *BufferSize = Needed;
    return EFI_SUCCESS;
  }
  EFI_STATUS Provisional = *BufferSize < 2 ? EFI_BUFFER_TOO_SMALL : EFI_NOT_FOUND;
  NW_OPEN_FILE *Root = Volume->Root;
  if (Root != nullptr) {
    LoadDirEntries(Root);
  }
  if (Root == nullptr || NwListIsEmpty(&Root->DirEntries)) {
    return EFI_UNSUPPORTED;
  }
  for (NW_LIST_LINK *Link = Root->DirEntries.First; Link != nullptr; Link = Link->Next) {
    NW_DIR_ENTRY *Entry = NW_LIST_OWNER(Link, NW_DIR_ENTRY, Link);
    UINT64 Attribute = Entry->Entry.Attribute;
    if ((Attribute & EFI_FILE_RESERVED) == 0 || (Attribute & EFI_FILE_DIRECTORY) != 0 ||
        Entry->FileName == nullptr) {
      continue;
    }
    UINTN Length = LabelLength(Entry->FileName);
    if (2 * Length < 23) {
      CopyWithoutDots(Volume->VolumeID, Entry->FileName);
      Volume->Valid = 1;
    }
    if (*BufferSize < 2 * Length + 2 || Out == nullptr) {
      *BufferSize = 2 * Length + 2;
      return EFI_BUFFER_TOO_SMALL;
    }
    CopyWithoutDots(Out, Entry->FileName);
    *BufferSize = Length; // a count of characters, not bytes: callers rely on it
    return EFI_SUCCESS;
  }
  if (Provisional == EFI_NOT_FOUND && Out != nullptr) {
    Out[0] = 0;
    *BufferSize = 2;
    return EFI_SUCCESS;
  }
  *BufferSize = 2;
  return EFI_BUFFER_TOO_SMALL;
}

EFI_STATUS GetSystemInfo(NW_VOLUME *Volume, UINTN *BufferSize, void *Buffer) {
  UINTN LabelSize = 0;
  GetVolumeLabel(Volume, &LabelSize, nullptr);
  UINTN Needed = LabelSize + SIZE_OF_EFI_FILE_SYSTEM_INFO;
  if (*BufferSize < Needed || Buffer == nullptr) {
    *BufferSize = Needed;
    DiagLog(DIAG_ALWAYS, "Error! Buffer too small!\n");
    return EFI_BUFFER_TOO_SMALL;
  }
  auto *Info = static_cast<EFI_FILE_SYSTEM_INFO *>(Buffer);
  ZeroMem(Info, SIZE_OF_EFI_FILE_SYSTEM_INFO);
  Info->Size = Needed;
  Info->ReadOnly = Volume->ReadOnly;
  Info->VolumeSize = Volume->TotalSize;
  Info->FreeSpace = Volume->FreeSpace;
  Info->BlockSize = Volume->BlockSize;
  // The label goes in at byte 36 and sets the size to its own; a volume
  // without any label reports an empty one.
  UINTN LabelRoom = *BufferSize - SIZE_OF_EFI_FILE_SYSTEM_INFO;
  if (EFI_ERROR(GetVolumeLabel(Volume, &LabelRoom, Info->VolumeLabel))) {
    LabelRoom = 0;
  }
  *BufferSize = LabelRoom + SIZE_OF_EFI_FILE_SYSTEM_INFO;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI GetInfoFileHandle(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType,
                                    UINTN *BufferSize, void *Buffer) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    EFI_STATUS Status = NwValidateHandle(Handle, "GetInfoFileHandle");
    if (EFI_ERROR(Status)) {
      return Status;
    }
    if (InformationType == nullptr || BufferSize == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    if (EfiGuidEqual(*InformationType, gEfiFileInfoGuid)) {
      return GetFileInfoFromFH(Handle->OpenFile, BufferSize, Buffer);
    }
    if (EfiGuidEqual(*InformationType, gEfiFileSystemInfoGuid)) {
      return GetSystemInfo(Handle->OpenFile->Volume, BufferSize, Buffer);
    }
    if (EfiGuidEqual(*InformationType, gEfiFileSystemVolumeLabelInfoIdGuid)) {
      return GetVolumeLabel(Handle->OpenFile->Volume, BufferSize, Buffer);
    }
    return EFI_UNSUPPORTED;
  });
}

EFI_STATUS EFIAPI SetInfoFileHandle(EFI_FILE_PROTOCOL *This, const EFI_GUID *InformationType,
                                    UINTN BufferSize, void *Buffer) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    EFI_STATUS Status = NwValidateHandle(Handle, "SetInfoFileHandle");
    if (EFI_ERROR(Status)) {
      return Status;
    }
    if (InformationType == nullptr || Buffer == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    NW_VOLUME *Volume = Handle->OpenFile->Volume;
    if (Volume->ReadOnly != 0) {
      return EFI_WRITE_PROTECTED;
    }
    if (EfiGuidEqual(*InformationType, gEfiFileInfoGuid)) {
      return SetFileInfo(Handle, BufferSize, static_cast<const EFI_FILE_INFO *>(Buffer));
    }
    if (EfiGuidEqual(*InformationType, gEfiFileSystemInfoGuid)) {
      auto *Info = static_cast<const EFI_FILE_SYSTEM_INFO *>(Buffer);
      if (BufferSize < SIZE_OF_EFI_FILE_SYSTEM_INFO + 2 || Info->Size > BufferSize) {
        return EFI_BAD_BUFFER_SIZE;
      }
      Status = SetVolumeLabel(Volume, BufferSize - SIZE_OF_EFI_FILE_SYSTEM_INFO, Info->VolumeLabel);
    } else if (EfiGuidEqual(*InformationType, gEfiFileSystemVolumeLabelInfoIdGuid)) {
      Status = SetVolumeLabel(Volume, BufferSize, static_cast<const CHAR16 *>(Buffer));
    } else {
      return EFI_UNSUPPORTED;
    }
    return EFI_ERROR(Status) ? Status : FlushFileHandle(This);
  });
}
