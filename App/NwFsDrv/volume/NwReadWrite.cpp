// File data on the network volume: Read, Write, GetPosition, SetPosition,
// Flush, Close and Delete.
//
// The program reads one file from start to end, or writes one file from start
// to end, per run, so the transfer offsets are process-wide: gTotalByteRead is
// where the next read starts (back to 0 when a file handle is closed) and
// gWriteOffset is where the next write lands (never reset). Reading or
// writing two files in alternation therefore mixes their offsets; that is the
// design, not an accident.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "volume/NwVolume.h"

namespace {

constexpr UINT64 kMaxTransferRequest = 0xFFFFFFFFULL;

// Any status set on the handle, its record or its volume, warnings included.
bool AnyStatusSet(const NW_FILE_HANDLE *Handle) {
  return Handle->HandleStatus != EFI_SUCCESS || Handle->OpenFile->Error != EFI_SUCCESS ||
         Handle->OpenFile->Volume->VolumeStatus != EFI_SUCCESS;
}

// Close, with the choice of keeping the record for a caller that still works
// on it (Delete).
EFI_STATUS CloseHandle(NW_FILE_HANDLE *Handle, bool ReleaseRecord) {
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  if (OpenFile == nullptr) {
    // Invalidated by a delete through another handle, or by the volume's
    // clean-up: only the handle itself is left.
    FreeFileHandle(Handle->Volume, Handle);
    return EFI_SUCCESS;
  }
  NW_VOLUME *Volume = OpenFile->Volume;
  OpenFile->Deleted = 0;
  // Listings are fetched again on the next read, except the one the closed
  // entry was found in.
  DiscardListingsExcept(Volume, OpenFile->Parent);
  OpenFile->HandleCount--;
  FlushFileHandle(&Handle->Protocol);
  EFI_STATUS Status = EFI_SUCCESS;
  if (!NwIsDirectory(OpenFile)) {
    if (!NwAcquireBusyLock()) {
      Status = EFI_DEVICE_ERROR;
    } else {
      Status = GEE_NWFClose(Volume->shareInfo, &Handle->shareFileInfo);
      NwReleaseBusyLock();
      gTotalByteRead = 0;
    }
  }
  Handle->OpenFile = nullptr;
  FreeFileHandle(Volume, Handle);
  if (ReleaseRecord) {
    ReleaseOpenFile(OpenFile);
  }
  return Status;
}

// The state of one Read of a file.
struct ReadState {
  UINT8 *Staging;
  UINT64 Limit;      // most bytes this call may return
  UINT64 Total;      // bytes read in this call
  UINT64 FirstChunk; // size of the first chunk, 0 before it
  UINT64 Wanted;
};

UINT64 Remaining(UINT64 FileSize) {
  return gTotalByteRead >= FileSize ? 0 : FileSize - gTotalByteRead;
}

EFI_STATUS ReadChunks(NW_FILE_HANDLE *Handle, ReadState *State) {
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  UINT64 FileSize = OpenFile->DirectoryEntry.FileSize;
  EFI_STATUS Status = EFI_SUCCESS;
  UINT8 *Position = State->Staging;
  while (State->Wanted >= 1) {
    if (gTotalByteRead >= FileSize || State->Staging == nullptr) {
      break;
    }
    // Only whole chunks of the size the first one had fit this call.
    if (State->Total + State->FirstChunk > State->Limit) {
      break;
    }
    DiagLog(DIAG_VERBOSE, "Reading the file data: tempChunkSize = %ld\n", State->Wanted);
    UINT64 Length = State->Wanted;
    UINT64 Offset = gTotalByteRead;
    UINT64 ReadCount = 0;
    Status = GEE_NWFRead(OpenFile->Volume->shareInfo, &Handle->shareFileInfo, Position, &Length,
                         &Offset, &ReadCount);
    if (!EFI_ERROR(Status) && ReadCount > State->Wanted) {
      Status = EFI_DEVICE_ERROR; // more than was asked for: never trusted
    }
    if (!EFI_ERROR(Status) && ReadCount == 0) {
      // Bytes are still due before the size the file's entry gives: a read
      // that brings nothing is a failure, never the end of the file.
      Status = EFI_DEVICE_ERROR;
    }
    if (EFI_ERROR(Status)) {
      DiagError("GEE_NWFRead failed!", Status);
      DiagLog(DIAG_ALWAYS, "readCount = %ld\n", ReadCount);
      break;
    }
    if (State->FirstChunk == 0) {
      State->Limit -= State->Limit % ReadCount;
      State->FirstChunk = ReadCount;
    }
    gPrevReadOffset = Position;
    gTotalByteRead += ReadCount;
    State->Total += ReadCount;
    State->Wanted = State->Limit > State->Total ? State->Limit - State->Total : 0;
    if (State->Wanted > Remaining(FileSize)) {
      State->Wanted = Remaining(FileSize);
    }
    Position += ReadCount;
    DiagLog(DIAG_VERBOSE, "readCount = 0x%ld\n", ReadCount);
    DiagLog(DIAG_VERBOSE, "gPrevReadOffset = %ld\n",
            static_cast<UINT64>(gPrevReadOffset - State->Staging));
    DiagLog(DIAG_VERBOSE, "gTotalByteRead = %ld\n", gTotalByteRead);
    DiagLog(DIAG_VERBOSE, "totalChunkRead = %ld\n", State->Total);
    DiagLog(DIAG_VERBOSE, "tempChunkSize = %ld\n", State->Wanted);
  }
  return Status;
}

EFI_STATUS ReadFile(NW_FILE_HANDLE *Handle, UINTN *BufferSize, void *Buffer) {
  NW_OPEN_FILE *OpenFile = Handle->OpenFile;
  ReadState State = {};
  State.Limit = *BufferSize <= NW_MAX_READ_PER_CALL ? *BufferSize : NW_MAX_READ_PER_CALL;
  if (!NwAcquireBusyLock()) {
    return EFI_ABORTED;
  }
  // The data goes straight into the caller's buffer; what it held is
  // undefined after a failed read, whose size is 0.
  gReadBuffer = static_cast<UINT8 *>(Buffer);
  State.Staging = gReadBuffer;
  OpenFile->ReadInProgress = 1;

  UINT64 FileSize = OpenFile->DirectoryEntry.FileSize;
  State.Wanted = FileSize < *BufferSize ? FileSize : *BufferSize;
  if (gTotalByteRead != 0 && State.Wanted > Remaining(FileSize)) {
    State.Wanted = Remaining(FileSize);
  }
  if (State.Wanted > State.Limit) {
    State.Wanted = State.Limit;
  }
  DiagLog(DIAG_VERBOSE, "tempChunkSize = 0x%x (%ld)\n", static_cast<UINT32>(State.Wanted),
          State.Wanted);
  DiagLog(DIAG_VERBOSE, "FileSize = 0x%x (%ld)\n", static_cast<UINT32>(FileSize), FileSize);
  EFI_STATUS Status = ReadChunks(Handle, &State);
  NwReleaseBusyLock();
  *BufferSize = EFI_ERROR(Status) ? 0 : State.Total;
  gReadBuffer = nullptr;
  OpenFile->ReadInProgress = 0;
  return Status;
}

// One write request at the process-wide offset, which advances by what the
// request reports, failed or not. A request that reports fewer bytes than it
// was given failed: the file on the share would be short.
EFI_STATUS WriteAtOffset(NW_FILE_HANDLE *Handle, const UINT8 *Data, UINT64 *Length) {
  UINT64 Asked = *Length;
  EFI_STATUS Status = GEE_NWFWrite(Handle->OpenFile->Volume->shareInfo, &Handle->shareFileInfo,
                                   const_cast<UINT8 *>(Data), Length, gWriteOffset);
  if (*Length > Asked) {
    *Length = Asked;
    Status = EFI_ERROR(Status) ? Status : EFI_DEVICE_ERROR;
  }
  if (!EFI_ERROR(Status) && *Length < Asked) {
    DiagError("GEE_NWFWrite wrote fewer bytes than asked!", EFI_DEVICE_ERROR);
    Status = EFI_DEVICE_ERROR;
  }
  gWriteOffset += *Length;
  return Status;
}

} // namespace

EFI_STATUS EFIAPI ReadFileHandle(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    if (Handle == nullptr || BufferSize == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    if (*BufferSize > kMaxTransferRequest) {
      return EFI_INVALID_PARAMETER;
    }
    DiagLog(DIAG_VERBOSE, "BufferSize = 0x%x (%ld)\n", static_cast<UINT32>(*BufferSize),
            static_cast<UINT64>(*BufferSize));
    EFI_STATUS Status = NwValidateHandle(Handle, "ReadFileHandle");
    if (EFI_ERROR(Status)) {
      return Status;
    }
    if (Buffer == nullptr && *BufferSize != 0) {
      return EFI_INVALID_PARAMETER;
    }
    if (NwIsDirectory(Handle->OpenFile)) {
      return ReadDirectory(Handle, BufferSize, Buffer);
    }
    return ReadFile(Handle, BufferSize, Buffer);
  });
}

EFI_STATUS EFIAPI WriteFileHandle(EFI_FILE_PROTOCOL *This, UINTN *BufferSize, void *Buffer) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    if (Handle == nullptr || BufferSize == nullptr || *BufferSize > kMaxTransferRequest) {
      return EFI_INVALID_PARAMETER;
    }
    // The handle's status is remembered, not acted on: the write goes ahead on
    // any handle that still has its record.
    EFI_STATUS Status = ValidateCurrentStatus(Handle);
    if (Handle->OpenFile == nullptr || NwIsDirectory(Handle->OpenFile)) {
      return Status;
    }
    if (Buffer == nullptr && *BufferSize != 0) {
      return EFI_INVALID_PARAMETER;
    }
    if (!NwAcquireBusyLock()) {
      return EFI_ABORTED;
    }
    const UINT8 *Source = static_cast<const UINT8 *>(Buffer);
    if (*BufferSize > NW_MAX_WRITE_CHUNK) {
      DiagLog(DIAG_ALWAYS, "WriteFileHandle: BufferSize=%lld\n", static_cast<UINT64>(*BufferSize));
      UINT64 Total = 0;
      while (Total < *BufferSize) {
        UINT64 Chunk = *BufferSize - Total;
        Chunk = Chunk > NW_MAX_WRITE_CHUNK ? NW_MAX_WRITE_CHUNK : Chunk;
        DiagLog(DIAG_ALWAYS, "WriteFileHandle: WriteDatalen=%lld offset=%lld\n", Chunk,
                gWriteOffset);
        Status = WriteAtOffset(Handle, Source + Total, &Chunk);
        if (EFI_ERROR(Status)) {
          break;
        }
        Total += Chunk;
      }
      *BufferSize = Total;
    } else {
      DiagLog(DIAG_VERBOSE, "WriteFileHandle: BufferSize=%lld offset=%lld\n",
              static_cast<UINT64>(*BufferSize), gWriteOffset);
      UINT64 Length = *BufferSize;
      Status = WriteAtOffset(Handle, Source, &Length);
      *BufferSize = Length;
      DiagLog(DIAG_VERBOSE, "WriteFileHandle: BufferSize=%lld offset=%lld\n",
              static_cast<UINT64>(*BufferSize), gWriteOffset);
    }
    NwReleaseBusyLock();
    return Status;
  });
}

EFI_STATUS EFIAPI GetPositionFileHandle(EFI_FILE_PROTOCOL *This, UINT64 *Position) {
  NW_FILE_HANDLE *Handle = NwHandleOf(This);
  EFI_STATUS Status = ValidateCurrentStatus(Handle);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  if (Position == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  UINT64 Attribute = Handle->OpenFile->DirectoryEntry.Attribute;
  if (AnyStatusSet(Handle) || (Attribute & (EFI_FILE_DIRECTORY | EFI_FILE_RESERVED)) != 0) {
    return EFI_UNSUPPORTED;
  }
  *Position = Handle->Position;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI SetPositionFileHandle(EFI_FILE_PROTOCOL *This, UINT64 Position) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    EFI_STATUS Status = ValidateCurrentStatus(Handle);
    if (EFI_ERROR(Status)) {
      return Status;
    }
    if (AnyStatusSet(Handle)) {
      return EFI_UNSUPPORTED;
    }
    NW_OPEN_FILE *OpenFile = Handle->OpenFile;
    // A file keeps no position: reads and writes go by the process-wide
    // offsets. A directory can only be rewound, which steps the listing back.
    if (NwIsDirectory(OpenFile)) {
      if (Position != 0) {
        return EFI_UNSUPPORTED;
      }
      if (gDirReadIndex >= 1) {
        Handle->Position = gDirReadIndex - 1;
        gDirRewind = 1;
      }
    }
    if (OpenFile->DirectoryEntry.Attribute == EFI_FILE_DIRECTORY || Handle->FullPath == nullptr) {
      return EFI_SUCCESS;
    }
    if (!NwAcquireBusyLock()) {
      return EFI_ABORTED;
    }
    Status = GEE_NWFCommit(OpenFile->Volume->shareInfo, &Handle->shareFileInfo, 0);
    NwReleaseBusyLock();
    return Status;
  });
}

EFI_STATUS EFIAPI FlushFileHandle(EFI_FILE_PROTOCOL *This) {
  return ValidateCurrentStatus(NwHandleOf(This));
}

EFI_STATUS EFIAPI CloseFileHandle(EFI_FILE_PROTOCOL *This) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    if (Handle == nullptr) {
      return EFI_INVALID_PARAMETER;
    }
    return CloseHandle(Handle, true);
  });
}

EFI_STATUS EFIAPI DeleteFileHandle(EFI_FILE_PROTOCOL *This) {
  return NwTraced([&]() -> EFI_STATUS {
    NW_FILE_HANDLE *Handle = NwHandleOf(This);
    EFI_STATUS Status = NwValidateHandle(Handle, "DeleteFileHandle");
    if (EFI_ERROR(Status)) {
      return Status;
    }
    NW_OPEN_FILE *OpenFile = Handle->OpenFile;
    NW_VOLUME *Volume = OpenFile->Volume;
    bool Refused = Volume->ReadOnly != 0 || OpenFile->ROOTDIR != 0 ||
                   (OpenFile->DirectoryEntry.Attribute & EFI_FILE_READ_ONLY) != 0;
    // A directory can go only while its cached listing holds no more than
    // "." and "..".
    if (!Refused && NwIsDirectory(OpenFile)) {
      Refused = OpenFile->DirEntries.Count > 2;
      if (!Refused) {
        DiscardDirEntries(OpenFile);
      }
    }
    if (Refused) {
      CloseHandle(Handle, true);
      return EFI_WARN_DELETE_FAILURE;
    }
    OpenFile->EntryMarker = NW_ENTRY_DELETED;
    OpenFile->Deleted = 1;
    CHAR16 *Path = StrDup(Handle->FullPath != nullptr ? Handle->FullPath : u"");
    CloseHandle(Handle, false);
    if (Path == nullptr) {
      ReleaseOpenFile(OpenFile);
      return EFI_WARN_DELETE_FAILURE;
    }
    // Acknowledged locally by the network library: nothing is sent.
    if (!NwAcquireBusyLock()) {
      FreePool(Path);
      ReleaseOpenFile(OpenFile);
      return EFI_WARN_DELETE_FAILURE;
    }
    Status = GEE_NWRemove(Volume->shareInfo, Path);
    NwReleaseBusyLock();
    FreePool(Path);
    for (NW_LIST_LINK *Link = Volume->FileHandles.First; Link != nullptr; Link = Link->Next) {
      NW_FILE_HANDLE *Other = NW_LIST_OWNER(Link, NW_FILE_HANDLE, VolumeLink);
      if (Other->OpenFile == OpenFile) {
        Other->HandleStatus = EFI_NOT_FOUND;
        Other->OpenFile = nullptr;
        OpenFile->HandleCount--;
      }
    }
    ReleaseOpenFile(OpenFile);
    return EFI_ERROR(Status) ? EFI_WARN_DELETE_FAILURE : EFI_SUCCESS;
  });
}
