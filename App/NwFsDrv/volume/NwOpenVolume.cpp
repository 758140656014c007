// The network volume's records: the allocator, the root record, file-handle
// creation, the status check every file operation runs first, the release of
// open-file records, and OpenVolume.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

UINT64 gTotalByteRead = 0;
UINT8 *gPrevReadOffset = nullptr;
UINT8 *gReadBuffer = nullptr;
UINT64 gWriteOffset = 0;
UINT32 gDirReadIndex = 0;
UINT8 gDirRewind = 0;
UINT8 gDirFirstReadDone = 0;

namespace {

// Every block of the volume's allocator carries its size in front of it, so
// that the matching free can take it off the volume's byte count. The tag
// refuses a pointer that did not come from this allocator.
struct NW_BLOCK_HEADER {
  UINT64 Size;
  UINT64 Tag;
};
static_assert(sizeof(NW_BLOCK_HEADER) == 16, "block header keeps 16-byte alignment");
constexpr UINT64 kBlockTag = 0x4B434F4C42565746ULL;
constexpr UINT64 kBlockFreedTag = 0x44454552465F5746ULL;

// Keep-alive period restarted at the end of OpenVolume: 10 s in 100 ns units.
constexpr UINT64 kKeepAlivePeriod = 100000000;

constexpr UINT64 kKiloLimit = 0x100000;
constexpr UINT64 kMegaLimit = 0x40000000;

const CHAR16 kRootName[] = u"\\";

NW_VOLUME *VolumeOf(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This) {
  return reinterpret_cast<NW_VOLUME *>(This);
}

void SetKeepAliveTimer(NW_VOLUME *Volume, EFI_TIMER_DELAY Type, UINT64 Time,
                       EFI_STATUS *Status = nullptr) {
  EFI_EVENT Event = Volume->shareInfo->KeepAliveEvent;
  if (Event == nullptr) {
    return; // a volume installed without the mount's timer
  }
  EFI_STATUS Result = gBS->SetTimer(Event, Type, Time);
  if (Status != nullptr) {
    *Status = Result;
  }
}

// One statistics query under the busy lock.
EFI_STATUS QueryFsInfo(NW_VOLUME *Volume, EFI_FILE_SYSTEM_INFO *Stats) {
  if (!NwAcquireBusyLock()) {
    return EFI_DEVICE_ERROR;
  }
  ZeroMem(Stats, sizeof(*Stats));
  EFI_STATUS Status = GEE_NWGetFSInfo(Volume->shareInfo, Stats);
  NwReleaseBusyLock();
  return Status;
}

// "File System [" followed directly by the unit: the label deliberately
// carries no number, only the unit chosen by the volume's size field.
EFI_STATUS BuildVolumeLabel(NW_VOLUME *Volume) {
  void *Buffer = nullptr;
  EFI_STATUS Status = fsAllocateMemory(Volume, NW_VOLUME_LABEL_BYTES, &Buffer);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  const CHAR16 *Unit = Volume->TotalSize < kKiloLimit   ? u"KB]"
                       : Volume->TotalSize < kMegaLimit ? u"MB]"
                                                        : u"GB]";
  Volume->VolumeLabel = static_cast<CHAR16 *>(Buffer);
  constexpr UINTN Chars = NW_VOLUME_LABEL_BYTES / sizeof(CHAR16);
  StrCpyS(Volume->VolumeLabel, Chars, u"File System [");
  StrCatS(Volume->VolumeLabel, Chars, Unit);
  return EFI_SUCCESS;
}

void FreeRecordMemory(NW_OPEN_FILE *OpenFile) {
  NW_VOLUME *Volume = OpenFile->Volume;
  DiscardDirEntries(OpenFile);
  fsFreeMemory(Volume, OpenFile->FileName);
  fsFreeMemory(Volume, OpenFile->FullPath);
  fsFreeMemory(Volume, OpenFile);
}

bool HandleRefersTo(NW_VOLUME *Volume, const NW_OPEN_FILE *OpenFile) {
  for (NW_LIST_LINK *Link = Volume->FileHandles.First; Link != nullptr; Link = Link->Next) {
    if (NW_LIST_OWNER(Link, NW_FILE_HANDLE, VolumeLink)->OpenFile == OpenFile) {
      return true;
    }
  }
  return false;
}

bool RecordInUse(const NW_OPEN_FILE *OpenFile) {
  NW_VOLUME *Volume = OpenFile->Volume;
  return OpenFile->ROOTDIR != 0 || Volume->Root == OpenFile || OpenFile->HandleCount != 0 ||
         !NwListIsEmpty(&OpenFile->DirEntries) || !NwListIsEmpty(&OpenFile->Children) ||
         OpenFile->ReadInProgress != 0 || HandleRefersTo(Volume, OpenFile);
}

} // namespace

// ---------------------------------------------------------------------------
// Allocator
// ---------------------------------------------------------------------------
EFI_STATUS fsAllocateMemory(NW_VOLUME *Volume, UINTN Size, void **Buffer) {
  if (Volume == nullptr || Buffer == nullptr || Size > ~static_cast<UINTN>(0) / 2) {
    return EFI_INVALID_PARAMETER;
  }
  *Buffer = nullptr;
  auto *Header = static_cast<NW_BLOCK_HEADER *>(AllocateZeroPool(Size + sizeof(NW_BLOCK_HEADER)));
  if (Header == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  Header->Size = Size;
  Header->Tag = kBlockTag;
  Volume->AllocatedBytes += Size;
  *Buffer = Header + 1;
  return EFI_SUCCESS;
}

void fsFreeMemory(NW_VOLUME *Volume, void *Buffer) {
  if (Buffer == nullptr) {
    return;
  }
  NW_BLOCK_HEADER *Header = static_cast<NW_BLOCK_HEADER *>(Buffer) - 1;
  if (Header->Tag != kBlockTag) {
    DiagError("Freeing a block that is not the volume's!", EFI_INVALID_PARAMETER);
    return;
  }
  Header->Tag = kBlockFreedTag;
  if (Volume != nullptr) {
    Volume->AllocatedBytes -= Header->Size;
  }
  FreePool(Header);
}

CHAR16 *fsStrDup(NW_VOLUME *Volume, const CHAR16 *String, UINTN ExtraChars) {
  UINTN Length = String == nullptr ? 0 : StrLen(String);
  void *Buffer = nullptr;
  if (EFI_ERROR(fsAllocateMemory(Volume, (Length + 1 + ExtraChars) * sizeof(CHAR16), &Buffer))) {
    return nullptr;
  }
  if (Length != 0) {
    CopyMem(Buffer, String, Length * sizeof(CHAR16));
  }
  return static_cast<CHAR16 *>(Buffer);
}

// ---------------------------------------------------------------------------
// Busy lock around one network call
// ---------------------------------------------------------------------------
// The lock record is packed, so its event slot may sit at an odd address:
// the lock functions get aligned copies, written back afterwards.
bool NwAcquireBusyLock() {
  UINT8 Busy = NetworkBusyLock.Busy;
  EFI_EVENT Event = NetworkBusyLock.Event;
  BOOLEAN Held = AcquireNetworkBusyLock(&Busy, &Event, TRUE);
  NetworkBusyLock.Busy = Busy;
  NetworkBusyLock.Event = Event;
  return Held != FALSE;
}

void NwReleaseBusyLock() {
  UINT8 Busy = NetworkBusyLock.Busy;
  EFI_EVENT Event = NetworkBusyLock.Event;
  ReleaseNetworkBusyLock(&Busy, &Event);
  NetworkBusyLock.Busy = Busy;
  NetworkBusyLock.Event = Event;
}

// ---------------------------------------------------------------------------
// Records and handles
// ---------------------------------------------------------------------------
EFI_STATUS CreateRootRecord(NW_VOLUME *Volume, NW_OPEN_FILE **Root) {
  void *Buffer = nullptr;
  EFI_STATUS Status = fsAllocateMemory(Volume, sizeof(NW_OPEN_FILE), &Buffer);
  if (EFI_ERROR(Status)) {
    return EFI_OUT_OF_RESOURCES;
  }
  auto *Record = static_cast<NW_OPEN_FILE *>(Buffer);
  Record->Volume = Volume;
  Record->FileName = fsStrDup(Volume, kRootName);
  if (Record->FileName == nullptr) {
    fsFreeMemory(Volume, Record);
    return EFI_OUT_OF_RESOURCES;
  }
  Record->ROOTDIR = 1;
  Record->Error = EFI_SUCCESS;
  Record->DirectoryEntry.Attribute = EFI_FILE_DIRECTORY;
  NwListInit(&Record->DirEntries);
  NwListInit(&Record->Children);
  *Root = Record;
  return EFI_SUCCESS;
}

EFI_STATUS CreateFileHandleInstance(NW_OPEN_FILE *OpenFile, NW_FILE_HANDLE **Handle,
                                    UINT64 OpenMode) {
  if (OpenFile == nullptr || Handle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  NW_VOLUME *Volume = OpenFile->Volume;
  void *Buffer = nullptr;
  if (OpenFile->HandleCount == 0xFFFF ||
      EFI_ERROR(fsAllocateMemory(Volume, sizeof(NW_FILE_HANDLE), &Buffer))) {
    DiagLog(DIAG_ALWAYS, "%s: Memory allocation failed!\n", "CreateFileHandleInstance");
    return EFI_OUT_OF_RESOURCES;
  }
  auto *New = static_cast<NW_FILE_HANDLE *>(Buffer);
  New->HandleStatus = EFI_SUCCESS;
  New->Position = 0;
  New->OpenFile = OpenFile;
  New->OpenMode = OpenMode;
  New->Volume = Volume;
  New->Protocol =
      EFI_FILE_PROTOCOL{EFI_FILE_PROTOCOL_REVISION, OpenFileHandle,        CloseFileHandle,
                        DeleteFileHandle,           ReadFileHandle,        WriteFileHandle,
                        GetPositionFileHandle,      SetPositionFileHandle, GetInfoFileHandle,
                        SetInfoFileHandle,          FlushFileHandle};
  OpenFile->HandleCount++;
  NwListAppend(&Volume->FileHandles, &New->VolumeLink);
  *Handle = New;
  return EFI_SUCCESS;
}

EFI_STATUS ValidateCurrentStatus(NW_FILE_HANDLE *Handle) {
  if (Handle == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (Handle->HandleStatus != EFI_SUCCESS) {
    return Handle->HandleStatus;
  }
  if (Handle->OpenFile == nullptr) {
    return EFI_NOT_FOUND;
  }
  if (Handle->OpenFile->Error != EFI_SUCCESS) {
    return Handle->OpenFile->Error;
  }
  EFI_STATUS VolumeStatus = Handle->OpenFile->Volume->VolumeStatus;
  return EFI_ERROR(VolumeStatus) ? VolumeStatus : EFI_SUCCESS;
}

EFI_STATUS NwValidateHandle(NW_FILE_HANDLE *Handle, const CHAR8 *Function, UINT32 Line) {
  EFI_STATUS Status = ValidateCurrentStatus(Handle);
  if (EFI_ERROR(Status)) {
    DiagError("ValidateCurrentStatus failed!", Status, Function, Line);
  }
  return Status;
}

EFI_STATUS ReleaseOpenFile(NW_OPEN_FILE *OpenFile) {
  while (OpenFile != nullptr) {
    if (RecordInUse(OpenFile)) {
      return EFI_ACCESS_DENIED;
    }
    NW_VOLUME *Volume = OpenFile->Volume;
    NW_OPEN_FILE *Parent = OpenFile->Parent;
    NwListRemove(&Volume->OpenFiles, &OpenFile->VolumeLink);
    if (Parent != nullptr) {
      NwListRemove(&Parent->Children, &OpenFile->ChildLink);
    }
    FreeRecordMemory(OpenFile);
    // A parent that only stayed for this child goes with it; the root and
    // any record still in use stay.
    if (Parent == nullptr || RecordInUse(Parent)) {
      return EFI_SUCCESS;
    }
    OpenFile = Parent;
  }
  return EFI_INVALID_PARAMETER;
}

void FreeFileHandle(NW_VOLUME *Volume, NW_FILE_HANDLE *Handle) {
  NwListRemove(&Volume->FileHandles, &Handle->VolumeLink);
  fsFreeMemory(Volume, Handle->FullPath);
  fsFreeMemory(Volume, Handle);
}

void CleanupVolume(NW_VOLUME *Volume, EFI_STATUS Status) {
  for (NW_LIST_LINK *Link = Volume->FileHandles.First; Link != nullptr; Link = Link->Next) {
    NW_FILE_HANDLE *Handle = NW_LIST_OWNER(Link, NW_FILE_HANDLE, VolumeLink);
    Handle->HandleStatus = Status;
    Handle->OpenFile = nullptr;
  }
  while (Volume->OpenFiles.First != nullptr) {
    NW_LIST_LINK *Link = Volume->OpenFiles.First;
    NwListRemove(&Volume->OpenFiles, Link);
    FreeRecordMemory(NW_LIST_OWNER(Link, NW_OPEN_FILE, VolumeLink));
  }
  Volume->Root = nullptr;
}

// ---------------------------------------------------------------------------
// OpenVolume
// ---------------------------------------------------------------------------
namespace {

// OpenVolume proper, run while the keep-alive timer is cancelled.
EFI_STATUS OpenVolumeRoot(NW_VOLUME *Volume, NW_FILE_HANDLE **Root, EFI_FILE_SYSTEM_INFO *Stats) {
  EFI_STATUS Status = QueryFsInfo(Volume, Stats);
  if (Status != EFI_SUCCESS) {
    DiagError("GEE_NWGetFSInfo failed!", Status);
    if (Volume->Root == nullptr) {
      Volume->VolumeStatus = EFI_DEVICE_ERROR; // the root could not be opened
    }
    return EFI_DEVICE_ERROR;
  }
  if (Volume->Root == nullptr) {
    Volume->VolumeStatus = QueryFsInfo(Volume, Stats);
    if (EFI_ERROR(Volume->VolumeStatus)) {
      DiagError("GEE_NWGetFSInfo failed!", Volume->VolumeStatus);
      return Volume->VolumeStatus;
    }
    NW_OPEN_FILE *NewRoot = nullptr;
    Status = CreateRootRecord(Volume, &NewRoot);
    if (EFI_ERROR(Status)) {
      DiagError("Root record allocation failed!", Status);
      return Status;
    }
    Volume->Root = NewRoot;
    NwListAppend(&Volume->OpenFiles, &NewRoot->VolumeLink);
  }
  // Built once, from the size field as it stands before this call's
  // statistics are stored: a fresh volume therefore always says "KB]".
  if (Volume->VolumeLabel == nullptr) {
    Status = BuildVolumeLabel(Volume);
    if (EFI_ERROR(Status)) {
      DiagError("Volume label allocation failed!", Status);
      return Status;
    }
  }
  Status = CreateFileHandleInstance(Volume->Root, Root, EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE);
  Volume->VolumeStatus = Status;
  if (EFI_ERROR(Status)) {
    DiagError("CreateFileHandleInstance failed!", Status);
  }
  return Status;
}

} // namespace

EFI_STATUS EFIAPI OpenVolume(EFI_SIMPLE_FILE_SYSTEM_PROTOCOL *This, EFI_FILE_PROTOCOL **Root) {
  DiagEntry();
  NW_VOLUME *Volume = VolumeOf(This);
  if (Volume == nullptr || Root == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  bool DropRoot = Volume->Root != nullptr && (Volume->VolumeStatus == EFI_MEDIA_CHANGED ||
                                              Volume->VolumeStatus == EFI_NO_MEDIA);
  if (DropRoot) {
    CleanupVolume(Volume, Volume->VolumeStatus);
  }
  if (Volume->shareInfo == nullptr) {
    DiagError("Share information is missing!", EFI_DEVICE_ERROR);
    return EFI_DEVICE_ERROR;
  }
  // The keep-alive timer must not fire while the volume is being opened.
  SetKeepAliveTimer(Volume, TimerCancel, 0);
  EFI_FILE_SYSTEM_INFO Stats;
  NW_FILE_HANDLE *Handle = nullptr;
  EFI_STATUS Status = OpenVolumeRoot(Volume, &Handle, &Stats);
  if (!EFI_ERROR(Status)) {
    *Root = &Handle->Protocol;
    Volume->ReadOnly = Stats.ReadOnly;
    Volume->TotalSize = Stats.VolumeSize;
    Volume->FreeSpace = Stats.FreeSpace;
    Volume->BlockSize = Stats.BlockSize;
    gDirReadIndex = 0;
    gDirRewind = 0;
    gDirFirstReadDone = 0;
  }
  EFI_STATUS TimerStatus = EFI_SUCCESS;
  SetKeepAliveTimer(Volume, TimerPeriodic, kKeepAlivePeriod, &TimerStatus);
  Status = EFI_ERROR(Status) ? Status : TimerStatus;
  DiagExit(Status);
  return Status;
}
