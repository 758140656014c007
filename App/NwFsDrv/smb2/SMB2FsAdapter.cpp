// The SMB2 file-system adapter (see SMB2FsAdapter.h for who owns what).
#include "smb2/SMB2FsAdapter.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Signing.h"
#include "smb2/TcpTransport.h"

const NW_BACKEND gSMB2FsBackend = {
    NW_BACKEND_REVISION, SMB2_FSResetState, SMB2_FSConnect, SMB2_FSDisconnect,
    SMB2_FOpen,          SMB2_FRead,        SMB2_FWrite,    SMB2_FClose,
    SMB2_GetFSInfo,      SMB2_FindFirst,    SMB2_FindNext,  SMB2_GetFileStat,
};

SMB2ConnectInfo gSMB2ConnectInfo;
SMB2ShareDetails gSMB2ShareDetails;
SMB2_CLIENT_SESSION gSMB2ClientSession;
FILE_ACCESS_DETAILS gFileAccessDetails;
QUERY_DETAILS gQueryDetails;
UINT32 gSMB2AdapterState;
SMB2_DIR_NODE *gDirNodePtr;
SMB2_DIR_NODE *gDirNodeCursor;

namespace {

constexpr UINT32 kReadAccess = 0x20089;         // read data, read EA, read attributes, read control
constexpr UINT32 kReadWriteAccess = 0xC0000187; // generic read/write, data, append, attributes
constexpr UINT32 kShareReadWrite = 3;
constexpr UINT32 kOpenExisting = 1;
constexpr UINT32 kOverwriteIf = 5;
constexpr UINT32 kNonDirectorySequential = 0x44;
constexpr UINT32 kImpersonation = 2;
constexpr UINT32 kOpenModeRead = 1;
constexpr UINT32 kOpenModeReadWrite = 2;
constexpr UINT64 kCreateRequested = 0x8;
constexpr UINTN kRemoteNameChars = 254;
constexpr UINTN kSharePathChars = 335;

FILE_ACCESS_DETAILS &Access() {
  return gFileAccessDetails;
}

EFI_STATUS InvalidParameter(const CHAR8 *Function) {
  Smb2Log(DIAG_ALWAYS, "%s Invalid parameter passed!\n", Function);
  return EFI_INVALID_PARAMETER;
}

// Names are relative to the share root: a leading separator of the
// volume's full path is dropped. At most MaxChars characters are kept.
void SetRemoteName(const CHAR8 *Name, UINTN MaxChars) {
  ZeroMem(Access().FileName, SMB2_FILE_NAME_FIELD);
  if (Name == nullptr) {
    return;
  }
  while (*Name == '\\') {
    Name++;
  }
  AsciiStrCpyS(Access().FileName, MaxChars + 1, Name);
}

void SetRemoteNameWide(const CHAR16 *Name, UINTN MaxChars) {
  CHAR8 Narrow[SMB2_FILE_NAME_FIELD];
  ZeroMem(Narrow, sizeof(Narrow));
  if (Name != nullptr) {
    while (*Name == u'\\') {
      Name++;
    }
    UnicodeStrToAsciiS(Name, Narrow, MaxChars + 1);
  }
  SetRemoteName(Narrow, MaxChars);
}

// The create fields of a read-only open of an existing file.
void SetReadOnlyOpen(UINT8 Oplock) {
  FILE_ACCESS_DETAILS &F = Access();
  F.SecurityFlags = 0;
  F.RequestedOplockLevel = Oplock;
  F.ImpersonationLevel = kImpersonation;
  F.SmbCreateFlags = 0;
  F.DesiredAccess = kReadAccess;
  F.FileAttributes = 0;
  F.ShareAccess = kShareReadWrite;
  F.CreateDisposition = kOpenExisting;
  F.CreateOptions = 0;
  F.OpenMode = kOpenModeRead;
}

// The per-transfer preparation shared by read and write.
void PrepareTransfer(const NW_REMOTE_FILE *File, UINT64 Offset, UINT32 Length) {
  FILE_ACCESS_DETAILS &F = Access();
  gSMB2ShareDetails.LastStatus = STATUS_UNSUCCESSFUL;
  SetReadOnlyOpen(File->OplockLevel);
  F.ReadWriteInfo.Length = Length;
  F.ReadWriteInfo.FileOffset = Offset;
  F.ReadWriteInfo.MinimumCount = 0;
  F.ReadWriteInfo.Channel = 0;
  F.ReadWriteInfo.RemainingBytes = 0;
  F.ReadWriteInfo.ChannelInfoLength = 0;
  CopyMem(F.FileId, File->FileId, SMB2_FILE_ID_SIZE);
}

// A failed request of a transfer: its line, and the read's special cases.
void ReportTransferFailure(bool Write, EFI_STATUS *Status) {
  if (Write) {
    DiagError("SMB2_Write failed!", *Status, "SMB2_FWrite", __LINE__);
    return;
  }
  DiagError("SMB2_Read Failed!", *Status, "SMB2_FRead", __LINE__);
  if (Access().TransportStatus == static_cast<UINT32>(NwErrno::ECONNRESET_)) {
    Smb2Log(DIAG_ALWAYS, "Server has reset, so exiting!\n");
  } else if (gSMB2ShareDetails.LastStatus == STATUS_END_OF_FILE) {
    // A read never writes the last status, so within a read this still
    // holds what the preparation set; the rule is kept as it stands.
    Smb2Log(DIAG_ALWAYS,
            "All the file bytes are read. Requested extra bytes. Exiting as success!\n");
    *Status = EFI_SUCCESS;
  }
}

// The most one request carries: 64512 bytes, or the server's negotiated
// maximum when that is smaller.
UINT32 RequestCap(bool Write) {
  UINT32 Max = Write ? gSMB2ShareDetails.MaxWriteSize : gSMB2ShareDetails.MaxReadSize;
  return Max != 0 && Max < SMB2_FS_MAX_CHUNK ? Max : SMB2_FS_MAX_CHUNK;
}

// The read or the write of *Size bytes at the prepared offset, in requests
// of at most RequestCap bytes, each advancing by what the server moved (a
// read starts with what the read-ahead holds and asks for a whole request
// at its tail). An
// answer that moves nothing (a read without data before the end asked for, a
// write the server did not take), or more short answers than allowed, fails
// the transfer. *Size receives what was moved.
// The rest of a read's last request that its caller did not ask for, kept
// for the next read of the same file if it begins where this one ended: a
// caller whose buffer is no multiple of a request (a shell's copy) still
// reads in whole requests instead of a small one after every few.
struct READ_AHEAD {
  UINT8 FileId[SMB2_FILE_ID_SIZE];
  UINT64 Offset; // file offset of Data[Start]
  UINT32 Start;
  UINT32 Length; // bytes kept from Start
  UINT8 Data[SMB2_FS_MAX_CHUNK];
};
READ_AHEAD gReadAhead;

// Moves what the read-ahead holds for the open file at the current offset
// into Buffer (at most Wanted bytes); anything else it holds is dropped.
UINTN TakeReadAhead(UINT8 *Buffer, UINTN Wanted) {
  READ_AHEAD &Ahead = gReadAhead;
  SMB2_READ_WRITE_INFO &Rw = Access().ReadWriteInfo;
  if (Ahead.Length == 0 || Ahead.Offset != Rw.FileOffset ||
      CompareMem(Ahead.FileId, Access().FileId, SMB2_FILE_ID_SIZE) != 0) {
    Ahead.Length = 0;
    return 0;
  }
  UINTN Taken = Wanted < Ahead.Length ? Wanted : Ahead.Length;
  CopyMem(Buffer, Ahead.Data + Ahead.Start, Taken);
  Ahead.Start += static_cast<UINT32>(Taken);
  Ahead.Length -= static_cast<UINT32>(Taken);
  Ahead.Offset += Taken;
  Rw.FileOffset += Taken;
  return Taken;
}

// Keeps what a read-ahead request brought beyond the Used bytes its caller
// wanted.
void KeepReadAhead(UINT64 Used, UINT64 Moved) {
  READ_AHEAD &Ahead = gReadAhead;
  CopyMem(Ahead.FileId, Access().FileId, SMB2_FILE_ID_SIZE);
  Ahead.Start = static_cast<UINT32>(Used);
  Ahead.Length = static_cast<UINT32>(Moved - Used);
  Ahead.Offset = Access().ReadWriteInfo.FileOffset + Used;
}

EFI_STATUS Transfer(bool Write, UINT8 *Buffer, UINTN *Size) {
  FILE_ACCESS_DETAILS &F = Access();
  SMB2_READ_WRITE_INFO &Rw = F.ReadWriteInfo;
  const UINTN Requested = *Size;
  const UINT32 Cap = RequestCap(Write);
  UINTN Total = 0;
  if (Write) {
    gReadAhead.Length = 0;
  } else {
    Total = TakeReadAhead(Buffer, Requested);
  }
  UINT32 ShortAnswers = 0;
  EFI_STATUS Status = EFI_SUCCESS;
  while (Total < Requested) {
    const UINTN Left = Requested - Total;
    // The tail of a read asks for a whole request; its rest is kept.
    const bool Ahead = !Write && Left < Cap;
    Rw.Length = static_cast<UINT32>(Ahead || Left > Cap ? Cap : Left);
    Rw.BytesRead = 0;
    Rw.BytesWritten = 0;
    UINT8 *Target = Ahead ? gReadAhead.Data : Buffer + Total;
    Status = Write ? SMB2_Write(&gSMB2ShareDetails, &gSMB2ClientSession, &gQueryDetails, &F, Target)
                   : SMB2_Read(&gSMB2ShareDetails, &gSMB2ClientSession, &gQueryDetails, &F, Target);
    if (EFI_ERROR(Status)) {
      ReportTransferFailure(Write, &Status);
      break;
    }
    UINT64 Moved = Write ? Rw.BytesWritten : Rw.BytesRead;
    UINT64 Needed = Ahead ? Left : Rw.Length;
    if (Moved < Needed && (Moved == 0 || ++ShortAnswers > SMB2_FS_MAX_SHORT_ANSWERS)) {
      Smb2Log(DIAG_ALWAYS,
              "Function: %s, Line no.: = %d, %s of %u bytes at offset %ld moved %ld bytes!\n",
              Write ? "SMB2_FWrite" : "SMB2_FRead", __LINE__, Write ? "WRITE" : "READ", Rw.Length,
              static_cast<INT64>(Rw.FileOffset), static_cast<INT64>(Moved));
      Status = EFI_DEVICE_ERROR;
      break;
    }
    if (Ahead) {
      UINT64 Used = Moved < Left ? Moved : Left;
      CopyMem(Buffer + Total, gReadAhead.Data, Used);
      KeepReadAhead(Used, Moved);
      Moved = Used;
    }
    Total += static_cast<UINTN>(Moved);
    Rw.FileOffset += Moved;
  }
  if (Write && Total == Requested && Requested != 0) {
    Smb2Log(DIAG_VERBOSE, "%s: All the bytes %ld are written\n", "SMB2_FWrite",
            static_cast<INT64>(Total));
  }
  *Size = Total;
  return Status;
}

// Opens the current FileName for reading when no file is open. *Opened
// tells the caller to close it again.
EFI_STATUS OpenIfNoneOpen(bool *Opened) {
  *Opened = false;
  if (!SMB2IsZeroFileId(Access().FileId)) {
    return EFI_SUCCESS;
  }
  SetReadOnlyOpen(SMB2_OPLOCK_LEVEL_NONE);
  EFI_STATUS Status = SMB2_Open(&gSMB2ShareDetails, &gSMB2ClientSession, &Access());
  if (EFI_ERROR(Status)) {
    DiagError("Open Failed!", Status);
    return Status;
  }
  *Opened = true;
  return EFI_SUCCESS;
}

void CloseIfOpened(bool Opened) {
  if (Opened) {
    SMB2_Close(&Access());
    ZeroMem(Access().FileId, SMB2_FILE_ID_SIZE);
  }
}

EFI_STATUS Query(UINT8 InfoType, UINT8 Class) {
  ZeroMem(&gQueryDetails, sizeof(gQueryDetails));
  gQueryDetails.InfoType = InfoType;
  gQueryDetails.FileInfoClass = Class;
  return SMB2_FSInfo(&gSMB2ShareDetails, &gSMB2ClientSession, &gQueryDetails, &Access());
}

void ReleaseListing() {
  FreeDirNodeList(&gDirNodePtr);
  gDirNodeCursor = nullptr;
}

void ReleaseConnectBuffers() {
  FreePool(gSMB2ConnectInfo.IpAddress);
  FreePool(gSMB2ConnectInfo.Username);
  if (gSMB2ConnectInfo.Password != nullptr) {
    ZeroMem(gSMB2ConnectInfo.Password, SMB2_FS_PASSWORD_BUFFER);
  }
  FreePool(gSMB2ConnectInfo.Password);
  FreePool(gSMB2ConnectInfo.Domain);
  FreePool(gSMB2ShareDetails.Sharename);
  ZeroMem(&gSMB2ConnectInfo, sizeof(gSMB2ConnectInfo));
  ZeroMem(&gSMB2ShareDetails, sizeof(gSMB2ShareDetails));
}

// Releases what FileAccessDetails owns and clears it with the query record,
// the session record and the listing.
void ReleaseFileRecords() {
  gReadAhead.Length = 0;
  FreePool(Access().DirInfoPtr);
  FreePool(Access().FullDirInfoPtr);
  SMB2FreeCreateContexts(&Access());
  ZeroMem(&gFileAccessDetails, sizeof(gFileAccessDetails));
  ZeroMem(&gQueryDetails, sizeof(gQueryDetails));
  ZeroMem(&gSMB2ClientSession, sizeof(gSMB2ClientSession));
  ReleaseListing();
}

CHAR8 *AllocateBuffer(UINTN Size, const CHAR8 *Failure) {
  CHAR8 *Buffer = static_cast<CHAR8 *>(AllocateZeroPool(Size));
  if (Buffer == nullptr) {
    Smb2Log(DIAG_ALWAYS, "%s", Failure);
  }
  return Buffer;
}

EFI_STATUS AllocateConnectBuffers() {
  SMB2ConnectInfo &Info = gSMB2ConnectInfo;
  Info.IpAddress = AllocateBuffer(SMB2_FS_IP_BUFFER, "IP Memory allocation failed!\n");
  if (Info.IpAddress == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  Info.Username = AllocateBuffer(SMB2_FS_USER_BUFFER + 1, "Username allocation failed!\n");
  if (Info.Username == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  Info.Password = AllocateBuffer(SMB2_FS_PASSWORD_BUFFER, "Password Memory allocation failed!\n");
  if (Info.Password == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  Info.Domain =
      AllocateBuffer(SMB2_FS_DOMAIN_BUFFER + 1, "Domain name Memory allocation failed!\n");
  if (Info.Domain == nullptr) {
    return EFI_OUT_OF_RESOURCES;
  }
  gSMB2ShareDetails.Sharename =
      AllocateBuffer(SMB2_FS_SHARENAME_BUFFER, "Sharename Memory allocation failed!\n");
  return gSMB2ShareDetails.Sharename == nullptr ? EFI_OUT_OF_RESOURCES : EFI_SUCCESS;
}

} // namespace

// ---------------------------------------------------------------------------
// Conversions
// ---------------------------------------------------------------------------
UINT64 SMB2MapAttributes(UINT32 Attributes) {
  UINT64 Result = 0;
  if ((Attributes & SMB2_ATTR_DIRECTORY) != 0) {
    Result |= EFI_FILE_DIRECTORY;
  }
  if ((Attributes & SMB2_ATTR_HIDDEN) != 0) {
    Result |= EFI_FILE_HIDDEN;
  }
  // Deliberately so: a "normal" file is reported with the system bit.
  if ((Attributes & SMB2_ATTR_NORMAL) != 0) {
    Result |= EFI_FILE_SYSTEM;
  }
  if ((Attributes & SMB2_ATTR_ARCHIVE) != 0) {
    Result |= EFI_FILE_ARCHIVE;
  }
  if ((Attributes & SMB2_ATTR_READONLY) != 0) {
    Result |= EFI_FILE_READ_ONLY;
  }
  return Result;
}

void SMB2ConvertFileTime(UINT64 FileTime, EFI_TIME *Time) {
  // The server's time is deliberately not reported.
  FillDefaultFileTime(static_cast<UINT32>(FileTime), Time);
}

EFI_STATUS SMB2_PopulateDirFileInfo(const SMB2_DIR_NODE *Node, EFI_FILE_INFO **Info) {
  if (Node == nullptr || Info == nullptr) {
    return EFI_INVALID_PARAMETER;
  }
  if (Node->FileNameLength > 510) {
    Smb2Log(DIAG_ALWAYS, "Length %d is greater than 255\n", Node->FileNameLength);
    return EFI_BUFFER_TOO_SMALL;
  }
  UINTN Size = (static_cast<UINTN>(Node->FileNameLength) + 1) * 2 + SIZE_OF_EFI_FILE_INFO;
  UINTN Allocation =
      Size < SMB2_FS_MIN_FILE_INFO_ALLOCATION ? SMB2_FS_MIN_FILE_INFO_ALLOCATION : Size;
  EFI_FILE_INFO *Entry = static_cast<EFI_FILE_INFO *>(AllocateZeroPool(Allocation));
  if (Entry == nullptr) {
    Smb2Log(DIAG_ALWAYS, "%05d %s Memory allocation failed!\n", __LINE__, __func__);
    return EFI_OUT_OF_RESOURCES;
  }
  Entry->Size = Size;
  Entry->FileSize = Node->EndOfFile;
  Entry->PhysicalSize = Node->AllocationSize;
  SMB2ConvertFileTime(Node->CreationTime, &Entry->CreateTime);
  SMB2ConvertFileTime(Node->LastAccessTime, &Entry->LastAccessTime);
  SMB2ConvertFileTime(Node->ChangeTime, &Entry->ModificationTime);
  Entry->Attribute = SMB2MapAttributes(Node->FileAttributes);
  CopyMem(Entry->FileName, Node->FileName, Node->FileNameLength);
  *Info = Entry;
  return EFI_SUCCESS;
}

// ---------------------------------------------------------------------------
// Connect and disconnect
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_FSResetState() {
  ReleaseConnectBuffers();
  ReleaseFileRecords();
  // A connect that failed part-way leaves its socket open for a disconnect
  // that, after a failed mount, never comes: it is closed here.
  if (gSMB2SockFd != 0) {
    TCP_CloseSocket(gSMB2SockFd);
    gSMB2SockFd = 0;
  }
  FreePool(TransactDetails.ChallResponse);
  ZeroMem(&TransactDetails, sizeof(TransactDetails));
  SMB2ConnectionState = SMB2_STATE_CLOSED;
  SMB2ResetConnectionHealth();
  SMB2SigningReset();
  gSMB2AdapterState = 0;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2_FSConnect(const NW_CONNECTION_PARAMS *Params, const NW_SHARE_INFO *Share) {
  DiagShortEntry(DiagChannel::Smb2);
  if (Params == nullptr || Share == nullptr) {
    Smb2Log(DIAG_ALWAYS, "%s: Invalid parameter passed!\n", __func__);
    return EFI_INVALID_PARAMETER;
  }
  ReleaseConnectBuffers();
  EFI_STATUS Status = AllocateConnectBuffers();
  if (EFI_ERROR(Status)) {
    return Status;
  }
  SMB2ConnectInfo &Info = gSMB2ConnectInfo;
  CHAR8 Login[SMB2_FS_LOGIN_CHARS + 1];
  ZeroMem(Login, sizeof(Login));
  if (Params->username != nullptr) {
    UnicodeStrToAsciiS(Params->username, Login, sizeof(Login));
  }
  // A name without separator is no error: it is the user, with no domain.
  SplitUserAndDomain(Login, SMB2_FS_USER_BUFFER, Info.Username, SMB2_FS_DOMAIN_BUFFER, Info.Domain);
  if (Params->ipAddress != nullptr) {
    UnicodeStrToAsciiS(Params->ipAddress, Info.IpAddress, SMB2_FS_IP_BUFFER);
  }
  if (Params->password != nullptr) {
    UnicodeStrToAsciiS(Params->password, Info.Password, SMB2_FS_PASSWORD_BUFFER);
  }
  CHAR8 ShareName[SMB2_FS_SHARE_CHARS + 1];
  ZeroMem(ShareName, sizeof(ShareName));
  if (Share->sharename != nullptr) {
    UnicodeStrToAsciiS(Share->sharename, ShareName, sizeof(ShareName));
  }
  AsciiSPrint(gSMB2ShareDetails.Sharename, SMB2_FS_SHARENAME_BUFFER, "\\\\%s\\%s", Info.IpAddress,
              ShareName);
  Smb2Log(DIAG_VERBOSE, "Sharename = %s\n", gSMB2ShareDetails.Sharename);
  gSMB2ShareDetails.LastStatus = STATUS_UNSUCCESSFUL;
  Info.Connected = 0;
  Status = SMB2_Connect(&Info, &gSMB2ShareDetails);
  if (!EFI_ERROR(Status)) {
    gSMB2AdapterState = SMB2_FS_STATE_READY;
  }
  DiagShortExit(Status, ',', DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2_FSDisconnect() {
  DiagShortEntry(DiagChannel::Smb2);
  EFI_STATUS Status = SMB2_Disconnect(&gSMB2ConnectInfo, &gSMB2ShareDetails);
  ReleaseConnectBuffers();
  // The records and any unfinished listing go with the connection.
  ReleaseFileRecords();
  gSMB2AdapterState = 0;
  DiagShortExit(Status, ',', DiagChannel::Smb2);
  return Status;
}

// ---------------------------------------------------------------------------
// One file
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_FOpen(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, UINT64 OpenMode,
                      UINT64 OpenFlags) {
  if (Volume == nullptr || File == nullptr) {
    return InvalidParameter(__func__);
  }
  FILE_ACCESS_DETAILS &F = Access();
  gReadAhead.Length = 0;
  SetRemoteNameWide(File->FileName, kRemoteNameChars);
  F.SecurityFlags = 0;
  F.RequestedOplockLevel = File->OplockLevel;
  F.ImpersonationLevel = kImpersonation;
  F.SmbCreateFlags = 0;
  if (OpenMode == EFI_FILE_MODE_READ) {
    SetReadOnlyOpen(File->OplockLevel);
    Smb2Log(DIAG_VERBOSE, "%05d %s: Setting READ only mode = 0x%x\n", __LINE__, __func__,
            static_cast<UINT32>(OpenMode));
  } else if ((OpenMode & (EFI_FILE_MODE_READ | EFI_FILE_MODE_WRITE)) != 0 &&
             (OpenFlags & kCreateRequested) != 0) {
    // FileAttributes deliberately keeps what the previous open left.
    F.DesiredAccess = kReadWriteAccess;
    F.ShareAccess = kShareReadWrite;
    F.CreateDisposition = kOverwriteIf;
    F.CreateOptions = kNonDirectorySequential;
    F.OpenMode = kOpenModeReadWrite;
    Smb2Log(DIAG_VERBOSE, "%05d %s: Setting READ Write mode = 0x%x\n", __LINE__, __func__,
            static_cast<UINT32>(OpenMode));
  }
  // Any other combination opens with the create fields the last open left.
  EFI_STATUS Status = SMB2_Open(&gSMB2ShareDetails, &gSMB2ClientSession, &F);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_Open failed!", Status);
    return Status;
  }
  gSMB2AdapterState = SMB2_FS_STATE_READY;
  CopyMem(File->FileId, F.FileId, SMB2_FILE_ID_SIZE);
  return Status;
}

EFI_STATUS SMB2_FRead(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, void *Buffer, UINTN *Size,
                      UINT64 Offset) {
  if (Volume == nullptr || File == nullptr || Buffer == nullptr || Size == nullptr) {
    return InvalidParameter(__func__);
  }
  PrepareTransfer(File, Offset, static_cast<UINT32>(*Size));
  return Transfer(false, static_cast<UINT8 *>(Buffer), Size);
}

EFI_STATUS SMB2_FWrite(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File, const void *Buffer, UINTN *Size,
                       UINT64 Offset) {
  if (Volume == nullptr || File == nullptr || Buffer == nullptr || Size == nullptr) {
    return InvalidParameter(__func__);
  }
  // The query record doubles as the write channel-info record: no channel.
  gQueryDetails.InputBufferLength = 0;
  PrepareTransfer(File, Offset, static_cast<UINT32>(*Size));
  EFI_STATUS Status = Transfer(true, static_cast<UINT8 *>(const_cast<void *>(Buffer)), Size);
  Smb2Log(DIAG_VERBOSE, "%s: Total bytes written = %ld\n", __func__, static_cast<INT64>(*Size));
  return Status;
}

EFI_STATUS SMB2_FClose(NW_SHARE_INFO *Volume, NW_REMOTE_FILE *File) {
  if (Volume == nullptr || File == nullptr) {
    return InvalidParameter(__func__);
  }
  FILE_ACCESS_DETAILS &F = Access();
  gReadAhead.Length = 0;
  CopyMem(F.FileId, File->FileId, SMB2_FILE_ID_SIZE);
  F.SecurityFlags = 0;
  EFI_STATUS Status = SMB2_Close(&F);
  ZeroMem(File->FileId, SMB2_FILE_ID_SIZE);
  ZeroMem(F.FileId, SMB2_FILE_ID_SIZE);
  return Status;
}

// ---------------------------------------------------------------------------
// Information
// ---------------------------------------------------------------------------
EFI_STATUS SMB2_GetFSInfo(NW_SHARE_INFO *Volume, EFI_FILE_SYSTEM_INFO *Info) {
  if (Volume == nullptr || Info == nullptr) {
    return InvalidParameter(__func__);
  }
  if (SMB2IsZeroFileId(Access().FileId)) {
    Smb2Log(DIAG_VERBOSE, "%s: Trying to open as FileId is 0\n", __func__);
  }
  bool Opened = false;
  EFI_STATUS Status = OpenIfNoneOpen(&Opened);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = Query(SMB2_INFO_FILESYSTEM, FILE_FS_SIZE_INFORMATION);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_FSInfo Failed!", Status);
  } else {
    const SMB2_FS_SIZE_INFO &Fs = Access().FsSize;
    UINT64 UnitBytes = static_cast<UINT64>(Fs.SectorsPerAllocationUnit) * Fs.BytesPerSector;
    Info->ReadOnly = FALSE;
    Info->VolumeSize = Fs.TotalAllocationUnits * UnitBytes;
    Info->FreeSpace = Fs.AvailableAllocationUnits * UnitBytes;
    Info->BlockSize = static_cast<UINT32>(UnitBytes);
    Smb2Log(DIAG_VERBOSE, "%05d %s: Dumping Filesystem Statistics\n", __LINE__, __func__);
    Smb2Log(DIAG_VERBOSE, "VolumeSize = %ld, FreeSpace = %ld, BlockSize = %d\n", Info->VolumeSize,
            Info->FreeSpace, Info->BlockSize);
  }
  CloseIfOpened(Opened);
  return Status;
}

EFI_STATUS SMB2_FindFirst(NW_SHARE_INFO *Share, const CHAR16 *Pattern, EFI_FILE_INFO **Entry) {
  if (Share == nullptr || Entry == nullptr) {
    return InvalidParameter(__func__);
  }
  *Entry = nullptr;
  // A listing left unfinished ends here.
  ReleaseListing();
  if (SMB2IsZeroFileId(Access().FileId)) {
    CHAR8 Path[kSharePathChars + 1];
    AsciiStrCpyS(Path, sizeof(Path), Share->FilePath);
    SetRemoteName(Path, kSharePathChars);
  }
  bool Opened = false;
  EFI_STATUS Status = OpenIfNoneOpen(&Opened);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  ZeroMem(&gQueryDetails, sizeof(gQueryDetails));
  gQueryDetails.InfoType = SMB2_INFO_FILE;
  gQueryDetails.FileInfoClass = FILE_FULL_DIRECTORY_INFORMATION;
  if (Pattern != nullptr) {
    gQueryDetails.InputBufferLength = static_cast<UINT32>(StrLen(Pattern) * 2);
    gQueryDetails.Buffer = reinterpret_cast<UINT8 *>(const_cast<CHAR16 *>(Pattern));
  }
  FreePool(Access().FullDirInfoPtr);
  Access().FullDirInfoPtr = nullptr;
  Access().FullDirInfoLength = 0;
  Access().RawFileInfo = nullptr;
  Status = SMB2_DirInfo(&gSMB2ShareDetails, &gSMB2ClientSession, &gQueryDetails, &Access());
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_DirInfo Failed!", Status);
  } else {
    Status = SMB2WalkDirectoryAnswer(&Access(), &gDirNodePtr);
  }
  gQueryDetails.Buffer = nullptr; // the pattern is the caller's
  if (EFI_ERROR(Status)) {
    ReleaseListing();
    DiagError("Read directory error!", Status);
  } else {
    // An answer without entries leaves the list empty, and the absent first
    // entry is refused below.
    gDirNodeCursor = gDirNodePtr;
    Status = SMB2_PopulateDirFileInfo(gDirNodeCursor, Entry);
    if (EFI_ERROR(Status)) {
      DiagError("SMB2_PopulateFileInfo failed!", Status);
    } else {
      gDirNodeCursor = gDirNodeCursor->Next;
    }
  }
  CloseIfOpened(Opened);
  return Status;
}

EFI_STATUS SMB2_FindNext(EFI_FILE_INFO **Entry) {
  if (Entry == nullptr) {
    return InvalidParameter(__func__);
  }
  if (gDirNodeCursor == nullptr) {
    Smb2Log(DIAG_VERBOSE, "List is absent!\n");
    ReleaseListing();
    return EFI_NOT_FOUND;
  }
  EFI_STATUS Status = SMB2_PopulateDirFileInfo(gDirNodeCursor, Entry);
  gDirNodeCursor = gDirNodeCursor->Next;
  return Status;
}

EFI_STATUS SMB2_GetFileStat(NW_SHARE_INFO *Volume, const CHAR16 *Path, EFI_FILE_INFO *Stat) {
  if (Volume == nullptr || Path == nullptr || Stat == nullptr) {
    return InvalidParameter(__func__);
  }
  if (SMB2IsZeroFileId(Access().FileId)) {
    SetRemoteNameWide(Path, kRemoteNameChars);
  }
  bool Opened = false;
  EFI_STATUS Status = OpenIfNoneOpen(&Opened);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  const SMB2_FILE_INFO_IMAGE &Image = Access().FileInfo;
  Status = Query(SMB2_INFO_FILE, FILE_BASIC_INFORMATION);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2_FSInfo Basic Info Failed!", Status);
  } else {
    SMB2ConvertFileTime(Image.CreationTime, &Stat->CreateTime);
    SMB2ConvertFileTime(Image.LastAccessTime, &Stat->LastAccessTime);
    SMB2ConvertFileTime(Image.ChangeTime, &Stat->ModificationTime);
    Stat->Attribute = SMB2MapAttributes(Image.FileAttributes);
    if (Image.FileAttributes == SMB2_ATTR_DIRECTORY) {
      Stat->Attribute = EFI_FILE_DIRECTORY;
    } else if (Image.FileAttributes == SMB2_ATTR_ARCHIVE) {
      Stat->Attribute = EFI_FILE_ARCHIVE;
    }
    Status = Query(SMB2_INFO_FILE, FILE_STANDARD_INFORMATION);
    if (EFI_ERROR(Status)) {
      DiagError("SMB2_FSInfo Std Info Failed!", Status);
    } else {
      Stat->FileSize = Image.EndOfFile;
      Stat->PhysicalSize = Image.AllocationSize;
    }
  }
  CloseIfOpened(Opened);
  return Status;
}
