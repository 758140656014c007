// Directory listings of the network volume: the cached entry list of a
// directory record, filled from the share with find-first/find-next, and Read
// on a directory handle, which hands out one EFI_FILE_INFO per call.
//
// The read index is process-wide, and the first successful Read after a
// reset delivers entry 0 without advancing: a listing of n entries takes
// n + 1 Reads with data and one Read that returns nothing. Callers of this
// volume depend on exactly that sequence.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

namespace {

constexpr UINTN kPatternBytes = 512;

// The name inside an adapter entry, bounded by the entry's own size.
UINTN EntryNameLength(const EFI_FILE_INFO *Info) {
  if (Info->Size <= SIZE_OF_EFI_FILE_INFO) {
    return 0;
  }
  return StrnLen(Info->FileName, (Info->Size - SIZE_OF_EFI_FILE_INFO) / sizeof(CHAR16));
}

// Stores the directory's path as the share's current file path, 8-bit and
// cut to what the share record holds.
void StoreSharePath(NW_VOLUME *Volume, const CHAR16 *Path) {
  if (Volume->shareInfo == nullptr) {
    DiagLog(DIAG_VERBOSE, "FilePath is not filled!\n");
    return;
  }
  UnicodeStrToAsciiS(Path, Volume->shareInfo->FilePath, NW_MAX_SHARE_FILE_PATH + 1);
  DiagLog(DIAG_VERBOSE, "FilePath = %s\n", Volume->shareInfo->FilePath);
}

// Takes one adapter entry into the listing. The entry record is the
// adapter's and is given back by the caller.
EFI_STATUS CacheEntry(NW_OPEN_FILE *Directory, const EFI_FILE_INFO *Info) {
  NW_DIRECTORY_ENTRY Entry;
  ZeroMem(&Entry, sizeof(Entry));
  CopyMem(&Entry, Info, SIZE_OF_EFI_FILE_INFO);
  UINTN NameLength = EntryNameLength(Info);
  if (NameLength == 0) {
    DiagLog(DIAG_VERBOSE, "fileInfo->FileName is NULL. Cannot add to dir!\n");
    return AddToDirList(Directory, &Entry, nullptr);
  }
  CHAR16 *Name = static_cast<CHAR16 *>(AllocateZeroPool((NameLength + 1) * sizeof(CHAR16)));
  if (Name == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  CopyMem(Name, Info->FileName, NameLength * sizeof(CHAR16));
  DiagLog(DIAG_VERBOSE, "Adding to dir: fileInfo->FileName = %ls\n", Name);
  EFI_STATUS Status = AddToDirList(Directory, &Entry, Name);
  FreePool(Name);
  return Status;
}

// Ends a listing: everything back to the start, nothing delivered.
EFI_STATUS EndOfListing(UINTN *BufferSize) {
  *BufferSize = 0;
  gDirReadIndex = 0;
  gDirRewind = 0;
  gDirFirstReadDone = 0;
  return EFI_SUCCESS;
}

} // namespace

EFI_STATUS AddToDirList(NW_OPEN_FILE *Directory, const NW_DIRECTORY_ENTRY *Entry,
                        const CHAR16 *FileName, NW_DIR_ENTRY **Added) {
  NW_VOLUME *Volume = Directory->Volume;
  void *Buffer = nullptr;
  EFI_STATUS Status = fsAllocateMemory(Volume, sizeof(NW_DIR_ENTRY), &Buffer);
  if (EFI_ERROR(Status)) {
    DiagError("fsAllocateMemory failed!", Status);
    return Status;
  }
  auto *Node = static_cast<NW_DIR_ENTRY *>(Buffer);
  CopyMem(&Node->Entry, Entry, sizeof(Node->Entry));
  if (FileName != nullptr) {
    // Room for two terminating characters, as every name copy has.
    Node->FileName = fsStrDup(Volume, FileName, 1);
    if (Node->FileName == nullptr) {
      fsFreeMemory(Volume, Node);
      DiagError("fsAllocateMemory failed!", EFI_OUT_OF_RESOURCES);
      return EFI_OUT_OF_RESOURCES;
    }
  }
  NwListAppend(&Directory->DirEntries, &Node->Link);
  Volume->CachedEntryCount++;
  if (Added != nullptr) {
    *Added = Node;
  }
  return EFI_SUCCESS;
}

void DiscardDirEntries(NW_OPEN_FILE *Directory) {
  NW_VOLUME *Volume = Directory->Volume;
  while (Directory->DirEntries.First != nullptr) {
    NW_LIST_LINK *Link = Directory->DirEntries.First;
    NwListRemove(&Directory->DirEntries, Link);
    NW_DIR_ENTRY *Node = NW_LIST_OWNER(Link, NW_DIR_ENTRY, Link);
    fsFreeMemory(Volume, Node->FileName);
    fsFreeMemory(Volume, Node);
    Volume->CachedEntryCount--;
  }
}

EFI_STATUS GetDirEntryByIndex(NW_LIST_HEAD *List, UINT32 Index, NW_DIR_ENTRY **Entry) {
  NW_LIST_LINK *Link = List->First;
  for (UINT32 I = 0; Link != nullptr && I < Index; I++) {
    Link = Link->Next;
  }
  if (Link == nullptr) {
    return EFI_NOT_FOUND;
  }
  *Entry = NW_LIST_OWNER(Link, NW_DIR_ENTRY, Link);
  return EFI_SUCCESS;
}

EFI_STATUS CreateFHFromDirEntryList(NW_DIR_ENTRY *Entry, NW_OPEN_FILE *Directory,
                                    NW_OPEN_FILE **Child) {
  if (Entry == nullptr || Directory == nullptr || Child == nullptr) {
    DiagLog(DIAG_ALWAYS, "Input parameter is NULL!\n");
    return EFI_INVALID_PARAMETER;
  }
  if (Entry->FileName == nullptr) {
    DiagLog(DIAG_ALWAYS, "Del->FileName is NULL!\n");
    return EFI_NOT_FOUND;
  }
  NW_VOLUME *Volume = Directory->Volume;
  void *Buffer = nullptr;
  EFI_STATUS Status = fsAllocateMemory(Volume, sizeof(NW_OPEN_FILE), &Buffer);
  if (EFI_ERROR(Status)) {
    DiagError("fsAllocateMemory failed!", Status);
    return Status;
  }
  auto *Record = static_cast<NW_OPEN_FILE *>(Buffer);
  Record->FileName = fsStrDup(Volume, Entry->FileName, 1);
  if (Record->FileName == nullptr) {
    fsFreeMemory(Volume, Record);
    DiagError("fsAllocateMemory failed!", EFI_OUT_OF_RESOURCES);
    return EFI_OUT_OF_RESOURCES;
  }
  Record->Volume = Volume;
  Record->Error = EFI_SUCCESS;
  Record->ROOTDIR = 0;
  CopyMem(&Record->DirectoryEntry, &Entry->Entry, sizeof(Record->DirectoryEntry));
  Record->Parent = Directory;
  NwListInit(&Record->DirEntries);
  NwListInit(&Record->Children);
  NwListAppend(&Directory->Children, &Record->ChildLink);
  NwListAppend(&Volume->OpenFiles, &Record->VolumeLink);
  *Child = Record;
  return EFI_SUCCESS;
}

EFI_STATUS ReadAllDirectoryEntries(NW_OPEN_FILE *Directory) {
  NW_VOLUME *Volume = Directory->Volume;
  CHAR16 *Path = nullptr;
  EFI_STATUS Status = FindCurrentLocation(Directory, &Path);
  if (EFI_ERROR(Status) || Path == nullptr) {
    Status = EFI_ERROR(Status) ? Status : EFI_NOT_FOUND;
    DiagError("FindCurrentLocation failed!", Status);
    return Status;
  }
  CHAR16 *Pattern = static_cast<CHAR16 *>(AllocateZeroPool(kPatternBytes));
  if (Pattern == nullptr) {
    fsFreeMemory(Volume, Path);
    DiagError("Memory allocation failed!", EFI_OUT_OF_RESOURCES);
    return EFI_OUT_OF_RESOURCES;
  }
  DiagLog(DIAG_VERBOSE, "tempStr = %ls (%d)\n", Path, static_cast<INT32>(StrLen(Path)));
  DiagLog(DIAG_VERBOSE, "pattern = %ls\n", Pattern);
  // Only a CIFS share is given a search pattern; any other share type
  // deliberately sends an empty one.
  if (Volume->shareInfo != nullptr && Volume->shareInfo->shareType == NW_SHARE_TYPE_CIFS) {
    Pattern[0] = u'*';
  }
  DiagLog(DIAG_VERBOSE, "Final pattern = %ls\n", Pattern);
  StoreSharePath(Volume, Path);
  fsFreeMemory(Volume, Path);

  if (!NwAcquireBusyLock()) {
    FreePool(Pattern);
    return EFI_ABORTED;
  }
  EFI_FILE_INFO *Info = nullptr;
  Status = GEE_NWFindFirst(Volume->shareInfo, Pattern, &Info);
  NwReleaseBusyLock();
  FreePool(Pattern);
  if (EFI_ERROR(Status) || Info == nullptr) {
    DiagErrorAt(DiagChannel::Driver, DIAG_VERBOSE, "GEE_NWFindFirst returned. ", Status);
    return Status;
  }
  // Every entry handed out is this side's to free; the walk keeps only the
  // current one.
  EFI_STATUS CacheStatus = EFI_SUCCESS;
  while (Status == EFI_SUCCESS) {
    CacheStatus = CacheEntry(Directory, Info);
    if (EFI_ERROR(CacheStatus)) {
      break;
    }
    if (!NwAcquireBusyLock()) {
      CacheStatus = EFI_ABORTED;
      break;
    }
    EFI_FILE_INFO *Next = Info;
    Status = GEE_NWFindNext(Volume->shareInfo, &Next);
    NwReleaseBusyLock();
    if (Next != Info && Next != nullptr) {
      FreePool(Info);
      Info = Next;
    }
    if (Next == nullptr) {
      Status = EFI_ERROR(Status) ? Status : EFI_NOT_FOUND;
    }
  }
  EFI_STATUS CloseStatus = EFI_ABORTED;
  if (NwAcquireBusyLock()) {
    CloseStatus = GEE_NWFindClose(Volume->shareInfo, Info);
    NwReleaseBusyLock();
  }
  FreePool(Info);
  return EFI_ERROR(CacheStatus) ? CacheStatus : CloseStatus;
}

EFI_STATUS LoadDirEntries(NW_OPEN_FILE *Directory) {
  if (Directory->DirtyListing != 0) {
    DiscardDirEntries(Directory);
    Directory->DirtyListing = 0;
  }
  return NwListIsEmpty(&Directory->DirEntries) ? ReadAllDirectoryEntries(Directory) : EFI_SUCCESS;
}

EFI_STATUS ReadDirectory(NW_FILE_HANDLE *Handle, UINTN *BufferSize, void *Buffer) {
  NW_OPEN_FILE *Directory = Handle->OpenFile;
  EFI_STATUS Status = LoadDirEntries(Directory);
  if (EFI_ERROR(Status)) {
    DiagError("ReadAllDirectoryEntries failed!", Status);
    if (Status == EFI_NOT_FOUND) {
      *BufferSize = 0;
    }
    return Status;
  }
  if (gDirRewind != 0) {
    gDirReadIndex = static_cast<UINT32>(Handle->Position);
  }
  NW_DIR_ENTRY *Entry = nullptr;
  if (EFI_ERROR(GetDirEntryByIndex(&Directory->DirEntries, gDirReadIndex, &Entry))) {
    return EndOfListing(BufferSize);
  }
  NW_OPEN_FILE *Child = nullptr;
  Status = CreateFHFromDirEntryList(Entry, Directory, &Child);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = GetFileInfoFromFH(Child, BufferSize, Buffer);
  if (EFI_ERROR(Status)) {
    // Index and flags stay: the next Read delivers the same entry.
    ReleaseOpenFile(Child);
    return Status;
  }
  if (gDirReadIndex < Directory->DirEntries.Count && gDirFirstReadDone == 1) {
    gDirReadIndex++;
  }
  if (gDirReadIndex > Directory->DirEntries.Count) {
    ReleaseOpenFile(Child);
    return EndOfListing(BufferSize);
  }
  gDirFirstReadDone = 1;
  ReleaseOpenFile(Child);
  if (gDirRewind != 0) {
    Status = EFI_SUCCESS;
    gDirRewind = 0;
    Handle->Position = 0;
  }
  return Status;
}

void DiscardListingsExcept(NW_VOLUME *Volume, const NW_OPEN_FILE *Keep) {
  for (NW_LIST_LINK *Link = Volume->OpenFiles.First; Link != nullptr; Link = Link->Next) {
    NW_OPEN_FILE *Record = NW_LIST_OWNER(Link, NW_OPEN_FILE, VolumeLink);
    if (Record != Keep) {
      DiscardDirEntries(Record);
    }
  }
}
