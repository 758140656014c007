// Open and create on the network volume: the path walk from a handle's
// directory (or the root), the matching of components against open records
// and cached listings, the creation of missing entries, and the record's full
// path on the share.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

namespace {

constexpr UINT64 kModeRead = EFI_FILE_MODE_READ;
constexpr UINT64 kModeReadWrite = EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE;
constexpr UINT64 kModeCreate = EFI_FILE_MODE_CREATE | kModeReadWrite;

// Open flags handed to the network open: create, or open an existing file.
constexpr UINT64 kOpenFlagsCreate = 0x8;
constexpr UINT64 kOpenFlagsExisting = 0x2;

CHAR16 FoldAscii(CHAR16 C) {
  return (C >= u'a' && C <= u'z') ? static_cast<CHAR16>(C - u'a' + u'A') : C;
}

bool IsDot(const CHAR16 *Name) {
  return Name[0] == u'.' && Name[1] == 0;
}
bool IsDotDot(const CHAR16 *Name) {
  return Name[0] == u'.' && Name[1] == u'.' && Name[2] == 0;
}

bool IsRoot(const NW_OPEN_FILE *OpenFile) {
  return OpenFile->ROOTDIR != 0 || OpenFile->Parent == nullptr;
}

// The parent a "." or ".." record stands for when its path is built.
NW_OPEN_FILE *PathStart(NW_OPEN_FILE *OpenFile) {
  if (!NwIsDirectory(OpenFile) || OpenFile->Parent == nullptr) {
    return OpenFile;
  }
  if (IsDot(OpenFile->FileName)) {
    return OpenFile->Parent;
  }
  if (IsDotDot(OpenFile->FileName)) {
    NW_OPEN_FILE *Parent = OpenFile->Parent;
    return IsRoot(Parent) ? Parent : Parent->Parent;
  }
  return OpenFile;
}

// Gives back a handle made during an open that did not complete.
void AbandonHandle(NW_FILE_HANDLE *Handle) {
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  NW_VOLUME *Volume = OpenFile->Volume;
  OpenFile->HandleCount--;
  FreeFileHandle(Volume, Handle);
  ReleaseOpenFile(OpenFile);
}

// A new directory lists "." and ".." from the start; the records the entries
// are made through are not kept.
EFI_STATUS AddDotEntries(NW_OPEN_FILE *Directory) {
  const CHAR16 *Names[] = {u".", u".."};
  for (const CHAR16 *Name : Names) {
    NW_OPEN_FILE *Dot = nullptr;
    EFI_STATUS Status = CreateDirectoryEntry(Directory, Name, &Dot, EFI_FILE_DIRECTORY);
    if (EFI_ERROR(Status)) {
      return Status;
    }
    ReleaseOpenFile(Dot);
  }
  return EFI_SUCCESS;
}

// Opens the remote file behind a new file handle.
EFI_STATUS OpenRemoteFile(NW_FILE_HANDLE *Handle, UINT64 OpenMode) {
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  if (OpenFile->DirectoryEntry.Attribute == NW_READ_ONLY_DIRECTORY &&
      (OpenMode & EFI_FILE_MODE_READ) != 0) {
    DiagError("Refusing a read-only directory entry!", EFI_ACCESS_DENIED);
    return EFI_ACCESS_DENIED;
  }
  if (NwIsDirectory(OpenFile)) {
    return EFI_SUCCESS;
  }
  UINT64 Flags = (OpenMode & EFI_FILE_MODE_CREATE) != 0 ? kOpenFlagsCreate : kOpenFlagsExisting;
  Handle->shareFileInfo.FileName = Handle->FullPath;
  if (!NwAcquireBusyLock()) {
    return EFI_ABORTED;
  }
  DiagLog(DIAG_VERBOSE, "fhi->shareFileInfo.fileName = %ls\n", Handle->shareFileInfo.FileName);
  DiagLog(DIAG_VERBOSE, "OpenMode = 0x%x, OpenAttib = 0x%x\n", static_cast<UINT32>(OpenMode),
          static_cast<UINT32>(Flags));
  EFI_STATUS Status =
      GEE_NWFOpen(OpenFile->Volume->shareInfo, &Handle->shareFileInfo, OpenMode, Flags);
  NwReleaseBusyLock();
  return Status;
}

// One step of the walk: the child of Directory called Component, from the
// open records or the cached listing. *Child stays null when there is none.
EFI_STATUS FindChild(NW_OPEN_FILE *Directory, const CHAR16 *Component, NW_OPEN_FILE **Child) {
  *Child = nullptr;
  if (!EFI_ERROR(FindMatchingFH(Directory->Volume, Component, Directory, Child))) {
    return EFI_SUCCESS;
  }
  EFI_STATUS Status = LoadDirEntries(Directory);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  NW_DIR_ENTRY *Entry = nullptr;
  if (FindMatchingDirEntry(Directory, Component, &Entry)) {
    return CreateFHFromDirEntryList(Entry, Directory, Child);
  }
  DiagLog(DIAG_VERBOSE, "FindMatchingDirEntry not found! \n");
  return EFI_SUCCESS;
}

// Walks Cursor component by component from Start. On success *Record is the
// record the path names or, when only the last component does not exist
// (*Missing), the directory it would be created in, with its name left in
// Component. On failure *Record is the last record reached.
EFI_STATUS WalkPath(NW_OPEN_FILE *Start, const CHAR16 *Cursor, CHAR16 *Component,
                    NW_OPEN_FILE **Record, bool *Missing) {
  NW_OPEN_FILE *Current = Start;
  *Missing = false;
  Component[0] = 0;
  EFI_STATUS Status = EFI_SUCCESS;
  while (*Cursor != 0) {
    if (EFI_ERROR(GetNextCompName(&Cursor, Component))) {
      DiagLog(DIAG_ALWAYS, "GetNextCompName returned error!\n");
      Status = EFI_NOT_FOUND;
      break;
    }
    if (Component[0] == 0) {
      Status = EFI_NOT_FOUND; // two separators in a row name nothing
      break;
    }
    if (IsDot(Component)) {
      continue;
    }
    if (IsDotDot(Component)) {
      Current = IsRoot(Current) ? Current : Current->Parent;
      continue;
    }
    if (!NwIsDirectory(Current)) {
      DiagLog(DIAG_ALWAYS, "Parent is not a directory. failed! Attr = 0x%lx\n",
              Current->DirectoryEntry.Attribute);
      Status = EFI_NOT_FOUND;
      break;
    }
    NW_OPEN_FILE *Child = nullptr;
    Status = FindChild(Current, Component, &Child);
    if (EFI_ERROR(Status)) {
      break;
    }
    if (Child == nullptr) {
      // Only the last component may be missing.
      *Missing = *Cursor == 0;
      Status = *Missing ? EFI_SUCCESS : EFI_NOT_FOUND;
      break;
    }
    Current = Child;
  }
  *Record = Current;
  return Status;
}

} // namespace

CHAR16 NwShareSeparator(const NW_VOLUME *Volume) {
  return (Volume->shareInfo != nullptr && Volume->shareInfo->shareType == NW_SHARE_TYPE_NFS)
             ? u'/'
             : u'\\';
}

bool NwNamesEqual(const CHAR16 *A, const CHAR16 *B) {
  for (;; A++, B++) {
    if (FoldAscii(*A) != FoldAscii(*B)) {
      return false;
    }
    if (*A == 0) {
      return true;
    }
  }
}

EFI_STATUS GetNextCompName(const CHAR16 **Cursor, CHAR16 *Component) {
  const CHAR16 *Path = *Cursor;
  if (StrnLen(Path, NW_MAX_REMAINING_PATH + 1) > NW_MAX_REMAINING_PATH) {
    return EFI_INVALID_PARAMETER;
  }
  UINTN Length = 0;
  while (Path[Length] != 0 && Path[Length] != u'\\') {
    Component[Length] = Path[Length];
    Length++;
  }
  Component[Length] = 0;
  if (Path[Length] == u'\\') {
    Length++;
    if (Path[Length] == 0) {
      return EFI_INVALID_PARAMETER; // a trailing backslash
    }
  }
  *Cursor = Path + Length;
  return EFI_SUCCESS;
}

EFI_STATUS FindMatchingFH(NW_VOLUME *, const CHAR16 *Component, NW_OPEN_FILE *Directory,
                          NW_OPEN_FILE **Match) {
  for (NW_LIST_LINK *Link = Directory->Children.First; Link != nullptr; Link = Link->Next) {
    NW_OPEN_FILE *Child = NW_LIST_OWNER(Link, NW_OPEN_FILE, ChildLink);
    if (Child->FileName == nullptr || !NwNamesEqual(Child->FileName, Component)) {
      continue;
    }
    DiagLog(DIAG_VERBOSE, "Both strings match!\n");
    DiagLog(DIAG_VERBOSE, "fh2->HandleStatus = 0x%x\n", static_cast<UINT32>(Child->Error));
    if (Child->Error == EFI_SUCCESS) {
      *Match = Child;
      return EFI_SUCCESS;
    }
  }
  DiagLog(DIAG_VERBOSE, "File match not found!\n");
  return EFI_NOT_FOUND;
}

bool FindMatchingDirEntry(NW_OPEN_FILE *Directory, const CHAR16 *Component, NW_DIR_ENTRY **Entry) {
  for (NW_LIST_LINK *Link = Directory->DirEntries.First; Link != nullptr; Link = Link->Next) {
    NW_DIR_ENTRY *Candidate = NW_LIST_OWNER(Link, NW_DIR_ENTRY, Link);
    if (Candidate->FileName != nullptr && NwNamesEqual(Candidate->FileName, Component)) {
      *Entry = Candidate;
      DiagLog(DIAG_VERBOSE, "%s: Returning true!\n", "FindMatchingDirEntry");
      return true;
    }
  }
  DiagLog(DIAG_VERBOSE, "%s: Returning false!\n", "FindMatchingDirEntry");
  return false;
}

EFI_STATUS CreateDirectoryEntry(NW_OPEN_FILE *Directory, const CHAR16 *Name, NW_OPEN_FILE **Record,
                                UINT64 Attribute) {
  NW_DIRECTORY_ENTRY Fresh;
  ZeroMem(&Fresh, sizeof(Fresh));
  Fresh.Attribute = Attribute;
  NW_DIR_ENTRY *Entry = nullptr;
  EFI_STATUS Status = AddToDirList(Directory, &Fresh, Name, &Entry);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (Attribute == EFI_FILE_DIRECTORY && !IsDot(Name) && !IsDotDot(Name)) {
    // Acknowledged locally by the network library: nothing is sent.
    if (!NwAcquireBusyLock()) {
      return EFI_ABORTED;
    }
    Status = GEE_NWMkdir(Directory->Volume->shareInfo, Name);
    NwReleaseBusyLock();
    if (EFI_ERROR(Status)) {
      DiagError("GEE_NWMkdir failed!", Status);
      return Status;
    }
  }
  return CreateFHFromDirEntryList(Entry, Directory, Record);
}

EFI_STATUS FindCurrentLocation(NW_OPEN_FILE *OpenFile, CHAR16 **FullPath) {
  if (OpenFile == nullptr || FullPath == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  DiagLog(DIAG_VERBOSE, "fH->FileName = %ls\n", OpenFile->FileName);
  DiagLog(DIAG_VERBOSE, "fH->FullPath = %ls\n", OpenFile->FullPath);
  DiagLog(DIAG_VERBOSE, "fH->ROOTDIR = %d\n", OpenFile->ROOTDIR);
  DiagLog(DIAG_VERBOSE, "fH->DirectoryEntry.Attribute = 0x%x\n",
          static_cast<UINT32>(OpenFile->DirectoryEntry.Attribute));
  NW_OPEN_FILE *Start = PathStart(OpenFile);
  CHAR16 Separator = NwShareSeparator(OpenFile->Volume);

  // Each record below the root contributes its name and one separator. The
  // limit counts the path with the separator in front of the first name; the
  // path handed out drops that one, because the share's protocol names files
  // relative to the share's root.
  UINTN Length = 0;
  for (NW_OPEN_FILE *Walk = Start; !IsRoot(Walk); Walk = Walk->Parent) {
    Length += (Walk->FileName == nullptr ? 0 : StrLen(Walk->FileName)) + 1;
    if (Length > NW_MAX_FULL_PATH) {
      DiagLog(DIAG_ALWAYS, "Error!: File path length %ld is more than %ld\n",
              static_cast<UINT64>(Length), static_cast<UINT64>(NW_MAX_FULL_PATH));
      DiagLog(DIAG_ALWAYS, "Returnung as Buffer too small!\n");
      return EFI_BUFFER_TOO_SMALL;
    }
  }
  Length = Length == 0 ? 0 : Length - 1;
  void *Buffer = nullptr;
  EFI_STATUS Status = fsAllocateMemory(OpenFile->Volume, Length * 2 + 2, &Buffer);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  auto *Path = static_cast<CHAR16 *>(Buffer);
  UINTN End = Length;
  for (NW_OPEN_FILE *Walk = Start; !IsRoot(Walk); Walk = Walk->Parent) {
    UINTN NameLength = Walk->FileName == nullptr ? 0 : StrLen(Walk->FileName);
    End -= NameLength;
    CopyMem(&Path[End], Walk->FileName, NameLength * sizeof(CHAR16));
    if (End != 0) {
      Path[--End] = Separator;
    }
  }
  *FullPath = Path;
  DiagLog(DIAG_VERBOSE, "currFullPath = %ls\n", Path);
  return EFI_SUCCESS;
}

EFI_STATUS ProcessOpenFileHandle(NW_FILE_HANDLE *Handle, const CHAR16 *FileName,
                                 NW_FILE_HANDLE **NewHandle, UINT64 OpenMode, UINT64 Attributes) {
  NW_OPEN_FILE *Start = Handle->OpenFile;
  if (Start->Error != EFI_SUCCESS) {
    DiagError("fh->HandleStatus error!", Start->Error);
    return Start->Error;
  }
  // The walk works on a copy: a path longer than 2 characters loses its
  // trailing backslash, and one that begins with a backslash starts at the
  // root.
  UINTN PathLength = StrLen(FileName);
  if (PathLength > 2 && FileName[PathLength - 1] == u'\\') {
    PathLength--;
  }
  CHAR16 *Path = static_cast<CHAR16 *>(AllocateZeroPool((PathLength + 1) * sizeof(CHAR16)));
  if (Path == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  CopyMem(Path, FileName, PathLength * sizeof(CHAR16));
  const CHAR16 *Cursor = Path;
  if (*Cursor == u'\\') {
    Start = Start->Volume->Root;
    Cursor++;
  }
  CHAR16 Component[NW_MAX_REMAINING_PATH + 1];
  NW_OPEN_FILE *Record = nullptr;
  bool Missing = false;
  EFI_STATUS Status = WalkPath(Start, Cursor, Component, &Record, &Missing);
  FreePool(Path);
  bool Created = false;
  if (!EFI_ERROR(Status) && Missing) {
    DiagLog(DIAG_ALWAYS, "%s (%d): No entry found!\n", "ProcessOpenFileHandle", __LINE__);
    if ((OpenMode & EFI_FILE_MODE_CREATE) == 0) {
      DiagLog(DIAG_ALWAYS, "%s (%d): No entry found and not in create mode!\n",
              "ProcessOpenFileHandle", __LINE__);
      Status = EFI_NOT_FOUND;
    } else {
      NW_OPEN_FILE *New = nullptr;
      Status = CreateDirectoryEntry(Record, Component, &New, Attributes);
      Record = EFI_ERROR(Status) ? Record : New;
      Created = !EFI_ERROR(Status);
    }
  }
  if (EFI_ERROR(Status)) {
    ReleaseOpenFile(Record); // records the walk made and nothing else holds
    return Status;
  }
  NW_FILE_HANDLE *New = nullptr;
  Status = CreateFileHandleInstance(Record, &New, OpenMode);
  if (EFI_ERROR(Status)) {
    ReleaseOpenFile(Record);
    return Status;
  }
  Status = FindCurrentLocation(Record, &New->FullPath);
  if (EFI_ERROR(Status)) {
    DiagError("FindCurrentLocation failed!", Status);
  } else if (Record->FullPath == nullptr) {
    Record->FullPath = fsStrDup(Record->Volume, New->FullPath);
  }
  if (!EFI_ERROR(Status) && Created && NwIsDirectory(Record)) {
    Status = AddDotEntries(Record);
  }
  if (!EFI_ERROR(Status)) {
    // A refusal here is the outcome of the open: it is recorded as such.
    Status = OpenRemoteFile(New, OpenMode);
    if (Status != EFI_SUCCESS) {
      SetOperationStatus(Status);
    }
  }
  if (EFI_ERROR(Status)) {
    AbandonHandle(New);
    return Status;
  }
  *NewHandle = New;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI OpenFileHandle(EFI_FILE_PROTOCOL *This, EFI_FILE_PROTOCOL **NewHandle,
                                 const CHAR16 *FileName, UINT64 OpenMode, UINT64 Attributes) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    if (Handle == nullptr || NewHandle == nullptr ||
        (OpenMode != kModeRead && OpenMode != kModeReadWrite && OpenMode != kModeCreate)) {
      return EFI_INVALID_PARAMETER;
    }
    if (Handle->OpenFile != nullptr && Handle->OpenFile->Volume->ReadOnly != 0 &&
        (OpenMode & EFI_FILE_MODE_WRITE) != 0) {
      return EFI_WRITE_PROTECTED;
    }
    EFI_STATUS Status = NwValidateHandle(Handle, "OpenFileHandle");
    if (EFI_ERROR(Status)) {
      return Status;
    }
    // Attributes outside the valid set answer "not found" rather than "invalid
    // parameter"; callers of this volume rely on that.
    if (FileName == nullptr || (Attributes & ~EFI_FILE_VALID_ATTR) != 0) {
      if (FileName == nullptr) {
        DiagLog(DIAG_ALWAYS, "FileName is NULL!\n");
      }
      return EFI_NOT_FOUND;
    }
    DiagLog(DIAG_VERBOSE, "%s: FileName = %ls\n", "OpenFileHandle", FileName);
    NW_FILE_HANDLE *New = nullptr;
    Status = ProcessOpenFileHandle(Handle, FileName, &New, OpenMode, Attributes);
    if (!EFI_ERROR(Status)) {
      *NewHandle = &New->Protocol;
    }
    return Status;
  });
}
