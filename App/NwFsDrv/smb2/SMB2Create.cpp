// SMB2 CREATE and CLOSE, and the pieces every file operation shares: the
// operation prologue and epilogue, the assembly of a request for the shared
// send loop, the start of a response (header and fixed body) and the drain
// of what a response announces beyond what the client reads.
//
// Ownership: the UTF-16 name buffer of a CREATE lives for one request. The
// lease and durable contexts stay referenced by FileAccessDetails after the
// request; a context replaces (and frees) the previous one of its kind, and
// SMB2FreeCreateContexts releases both when the adapter lets go of the
// record.
#include "smb2/SMB2FileAccess.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Ntlmssp.h"

SMB2_REQUEST_TRACE gSMB2RequestTrace[SMB2_REQUEST_TRACE_SLOTS];
UINT64 gSMB2RequestCount;

namespace {

constexpr UINT32 kLeaseDataLength = 32;
constexpr UINT32 kDurableDataLength = 16;
constexpr UINT16 kContextNameOffset = 16;
constexpr UINT16 kContextNameLength = 4;
constexpr UINT16 kContextDataOffset = 24;

void LogNull(const CHAR8 *Function, UINT32 Line) {
  DiagNullInput(DiagChannel::Smb2, Function, Line);
}

UINT32 RoundUp(UINT32 Value, UINT32 Alignment) {
  return (Value + Alignment - 1) / Alignment * Alignment;
}

void FillContextHeader(SMB2_CREATE_CONTEXT_HEADER *Header, const CHAR8 *Name, UINT32 DataLength) {
  Header->Next = 0;
  Header->NameOffset = kContextNameOffset;
  Header->NameLength = kContextNameLength;
  Header->Reserved = 0;
  Header->DataOffset = kContextDataOffset;
  Header->DataLength = DataLength;
  CopyMem(Header->Name, Name, kContextNameLength);
}

// Lease caching state asked for with an oplock level.
UINT32 LeaseStateFor(UINT8 OplockLevel) {
  switch (OplockLevel) {
  case SMB2_OPLOCK_LEVEL_II:
    return 1; // read caching
  case SMB2_OPLOCK_LEVEL_EXCLUSIVE:
    return 5; // read + write caching
  case SMB2_OPLOCK_LEVEL_BATCH:
    return 7; // read + handle + write caching
  default:
    return 0;
  }
}

void LogCreateResponse(const SMB2_CREATE_RESPONSE_BODY &Body) {
  if (!DiagEnabled(DiagChannel::Smb2, DIAG_VERBOSE)) {
    return;
  }
  const CHAR8 *F = "SMB2VerifyCreateResponse";
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File OplockLevel = 0x%x\n", F,
          __LINE__, Body.OplockLevel);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File Flags = 0x%x\n", F, __LINE__,
          Body.Flags);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File CreateAction = 0x%x\n", F,
          __LINE__, Body.CreateAction);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File LastAccessTime = 0x%lx\n", F,
          __LINE__, Body.LastAccessTime);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File LastWriteTime = 0x%lx\n", F,
          __LINE__, Body.LastWriteTime);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File ChangeTime = 0x%lx\n", F,
          __LINE__, Body.ChangeTime);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File AllocationSize = %ld\n", F,
          __LINE__, Body.AllocationSize);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File EndofFile = %ld\n", F, __LINE__,
          Body.EndofFile);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File FileAttributes = 0x%x\n", F,
          __LINE__, Body.FileAttributes);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File FileId = 0x", F, __LINE__);
  for (UINTN I = 0; I < SMB2_FILE_ID_SIZE; I++) {
    Smb2Log(DIAG_VERBOSE, "%02x", Body.FileId[I]);
  }
  Smb2Log(DIAG_VERBOSE, "\n");
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File CreateContextsOffset = %d\n", F,
          __LINE__, Body.CreateContextsOffset);
  Smb2Log(DIAG_VERBOSE, "Function: %s, Line no.: = %d, Server File CreateContextsLength = %d\n", F,
          __LINE__, Body.CreateContextsLength);
}

} // namespace

// ---------------------------------------------------------------------------
// Shared pieces
// ---------------------------------------------------------------------------
void SMB2TraceRequest(const SMB2_HEADER *Header, UINT32 Length, UINT64 Offset) {
  SMB2_REQUEST_TRACE &Slot = gSMB2RequestTrace[gSMB2RequestCount % SMB2_REQUEST_TRACE_SLOTS];
  Slot.Command = Header->Command;
  Slot.CreditCharge = Header->CreditCharge;
  Slot.Length = Length;
  Slot.Offset = Offset;
  gSMB2RequestCount++;
}

EFI_STATUS SMB2FileOpBegin(const CHAR8 *Function, UINT32 Line) {
  if (gSMB2SockFd == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, gSMB2SockFd is 0!\n", Function, Line);
    return EFI_NOT_FOUND;
  }
  TransactDetails.MessageId++;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2FileOpEnd(FILE_ACCESS_DETAILS *Access, UINT32 RequestCode, const CHAR8 *RequestName,
                         UINT32 ResponseCode, const CHAR8 *ResponseName, const CHAR8 *Function,
                         UINT32 Line) {
  Access->TransportStatus = TransactDetails.TransportStatus;
  if (RequestCode != SMB2_NT_SUCCESS) {
    return SMB2MapNtStatus(RequestCode, RequestName, Function, Line);
  }
  return SMB2MapNtStatus(ResponseCode, ResponseName, Function, Line);
}

UINT32 SMB2SendFileRequest(INT32 SockFd, const SMB2_SEND_PIECE *Pieces, UINT32 Count, UINT64 Total,
                           const CHAR8 *What, const CHAR8 *Function, UINT32 Line) {
  const void *Message = Pieces[0].Bytes;
  UINT8 *Assembled = nullptr;
  if (Count > 1 || Pieces[0].Length != Total || Message == nullptr) {
    Assembled = static_cast<UINT8 *>(AllocateZeroPool(Total + 1));
    if (Assembled == nullptr) {
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Buffer memory allocation failed!\n",
              Function, Line);
      return STATUS_NO_MEMORY;
    }
    UINT64 At = 0;
    for (UINT32 I = 0; I < Count; I++) {
      UINT64 Length = Pieces[I].Length < Total - At ? Pieces[I].Length : Total - At;
      if (Pieces[I].Bytes != nullptr) {
        CopyMem(Assembled + At, Pieces[I].Bytes, Length);
      }
      At += Length;
    }
    Message = Assembled;
  }
  UINT32 Transport = 0;
  // A request assembled here already sits in a buffer of its own; a single
  // piece gets its one copy from the send loop.
  UINT32 Code = Assembled != nullptr ? SMB2SendAll(SockFd, Assembled, Total, &Transport)
                                     : SMB2SendRequest(SockFd, Message, Total, &Transport);
  TransactDetails.TransportStatus = Transport;
  if (Code != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, %s request send failed! Status = 0x%x (%d)\n", Function,
            Line, What, Code, static_cast<INT32>(Code));
  }
  FreePool(Assembled);
  return Code;
}

UINT32 SMB2ReadResponseStart(INT32 SockFd, SMB2_HEADER *Header, void *Body, UINT32 BodySize,
                             bool ReadFixedBody, const CHAR8 *Function, UINT32 Line) {
  UINT32 Nt = STATUS_UNSUCCESSFUL;
  EFI_STATUS Status = SMB2ReadVerifyHeader(Header, &TransactDetails, SockFd, &Nt);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2ReadVerifyHeader failed!", Status, Function, Line);
    return Nt != SMB2_NT_SUCCESS ? Nt : STATUS_UNSUCCESSFUL;
  }
  UINT32 BodyLength = SMB2BodyLength(Header);
  if (BodyLength < BodySize) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Response body of %u bytes is shorter than its fixed "
            "part of %u bytes!\n",
            Function, Line, BodyLength, BodySize);
    SMB2DrainBytes(SockFd, BodyLength, &TransactDetails);
    return STATUS_UNSUCCESSFUL;
  }
  if (!ReadFixedBody) {
    return SMB2_NT_SUCCESS;
  }
  INT32 Rx = SMB2ReceiveAll(SockFd, Body, BodySize, &TransactDetails);
  if (Rx != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_PollAndTryToRxAllData failed! Status = %ld\n",
            Function, Line, static_cast<INT64>(Rx));
    return static_cast<UINT32>(Rx);
  }
  return SMB2_NT_SUCCESS;
}

bool SMB2IsZeroFileId(const UINT8 *FileId) {
  for (UINTN I = 0; I < SMB2_FILE_ID_SIZE; I++) {
    if (FileId[I] != 0) {
      return false;
    }
  }
  return true;
}

UINT32 SMB2ConstructFailureCode(EFI_STATUS Status) {
  if (Status == EFI_INVALID_PARAMETER) {
    return SMB2_NT_INVALID_PARAMETER;
  }
  return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
}

UINT32 SMB2DrainMessageRest(INT32 SockFd, const SMB2_HEADER *Header, UINT64 Consumed) {
  UINT64 BodyLength = SMB2BodyLength(Header);
  if (BodyLength <= Consumed) {
    return SMB2_NT_SUCCESS;
  }
  return SMB2DrainBytes(SockFd, BodyLength - Consumed, &TransactDetails);
}

// ---------------------------------------------------------------------------
// CREATE
// ---------------------------------------------------------------------------
EFI_STATUS SMB2CreateLeaseBuf(const UINT8 *LeaseKey, UINT8 OplockLevel, UINT8 **Context) {
  if (LeaseKey == nullptr || Context == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  auto *Lease =
      static_cast<SMB2_CREATE_LEASE_CONTEXT *>(AllocateZeroPool(sizeof(SMB2_CREATE_LEASE_CONTEXT)));
  if (Lease == nullptr) {
    SMB2PrintAllocFailure(__func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  FillContextHeader(&Lease->Header, "RqLs", kLeaseDataLength);
  CopyMem(Lease->LeaseKey, LeaseKey, sizeof(Lease->LeaseKey));
  Lease->LeaseState = LeaseStateFor(OplockLevel);
  *Context = reinterpret_cast<UINT8 *>(Lease);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2CreateDurableBuf(const UINT8 *LeaseKey, UINT8 OplockLevel, UINT8 **Context) {
  (void)OplockLevel; // the durable request carries no caching state
  if (LeaseKey == nullptr || Context == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  auto *Durable = static_cast<SMB2_CREATE_DURABLE_CONTEXT *>(
      AllocateZeroPool(sizeof(SMB2_CREATE_DURABLE_CONTEXT)));
  if (Durable == nullptr) {
    SMB2PrintAllocFailure(__func__, __LINE__);
    return EFI_OUT_OF_RESOURCES;
  }
  FillContextHeader(&Durable->Header, "DHnQ", kDurableDataLength);
  *Context = reinterpret_cast<UINT8 *>(Durable);
  return EFI_SUCCESS;
}

void SMB2FreeCreateContexts(FILE_ACCESS_DETAILS *Access) {
  FreePool(Access->LeaseContext);
  FreePool(Access->DurableContext);
  Access->LeaseContext = nullptr;
  Access->DurableContext = nullptr;
  Access->LeaseContextLength = 0;
  Access->DurableContextLength = 0;
}

EFI_STATUS SMB2CreateContextRequestPacketConstruct(SMB2_CREATE_REQUEST *Packet,
                                                   const TRANSACT_DETAILS *Details,
                                                   FILE_ACCESS_DETAILS *Access, UINT8 **Name,
                                                   UINT32 *NameSize, UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr || Name == nullptr ||
      NameSize == nullptr || TotalBytes == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  ZeroMem(Packet, sizeof(*Packet));
  *Name = nullptr;
  *NameSize = 0;
  *TotalBytes = 0;

  UINT32 Characters = static_cast<UINT32>(AsciiStrnLen(Access->FileName, SMB2_FILE_NAME_FIELD));
  if (Characters >= SMB2_FILE_NAME_LIMIT) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Filename length %d is longer than expected length %d\n",
            __func__, __LINE__, Characters, static_cast<INT32>(SMB2_FILE_NAME_LIMIT));
    return EFI_INVALID_PARAMETER;
  }
  UINT32 Padded = RoundUp(Characters * 2, SMB2_CREATE_NAME_ALIGN);
  if (Characters > 0) {
    *Name = static_cast<UINT8 *>(AllocateZeroPool(Padded));
    if (*Name == nullptr) {
      SMB2PrintAllocFailure(__func__, __LINE__);
      return EFI_OUT_OF_RESOURCES;
    }
    strtoUTF16(*Name, Access->FileName, SMB2_FILE_NAME_LIMIT, "default");
    *NameSize = Padded;
  }

  // The lease key: the oplock level plus one, then zeros.
  UINT8 LeaseKey[16] = {};
  LeaseKey[0] = static_cast<UINT8>(Access->RequestedOplockLevel + 1);
  UINT8 Oplock = Access->RequestedOplockLevel;
  bool Leasing = (Details->ServerCapabilities & SMB2_GLOBAL_CAP_LEASING) != 0;
  UINT32 ContextsLength = 0;
  UINT8 *Lease = nullptr;
  if (Leasing && Oplock != SMB2_OPLOCK_LEVEL_NONE) {
    EFI_STATUS Status = SMB2CreateLeaseBuf(LeaseKey, Oplock, &Lease);
    if (EFI_ERROR(Status)) {
      FreePool(*Name);
      *Name = nullptr;
      return Status;
    }
    Packet->CreateContextsOffset = SMB2_CREATE_NAME_OFFSET + Padded;
    ContextsLength += SMB2_LEASE_CONTEXT_SIZE;
  }
  UINT8 *Durable = nullptr;
  if (Oplock == SMB2_OPLOCK_LEVEL_BATCH) {
    if (Lease != nullptr) {
      reinterpret_cast<SMB2_CREATE_LEASE_CONTEXT *>(Lease)->Header.Next = SMB2_LEASE_CONTEXT_SIZE;
    }
    // Deliberately no CreateContextsOffset here: on a server without leasing
    // a batch request carries its 40 context bytes with offset 0.
    EFI_STATUS Status = SMB2CreateDurableBuf(LeaseKey, Oplock, &Durable);
    if (EFI_ERROR(Status)) {
      FreePool(Lease);
      FreePool(*Name);
      *Name = nullptr;
      return Status;
    }
    ContextsLength += SMB2_DURABLE_CONTEXT_SIZE;
  }
  // A freshly built context replaces (and releases) the one before it.
  if (Lease != nullptr) {
    FreePool(Access->LeaseContext);
    Access->LeaseContext = Lease;
    Access->LeaseContextLength = SMB2_LEASE_CONTEXT_SIZE;
  }
  if (Durable != nullptr) {
    FreePool(Access->DurableContext);
    Access->DurableContext = Durable;
    Access->DurableContextLength = SMB2_DURABLE_CONTEXT_SIZE;
  }

  UINT32 Total = sizeof(SMB2_CREATE_REQUEST) + Padded + ContextsLength + SMB2_CREATE_TRAILER;
  SMB2HeaderConstruct(&Packet->Header);
  SMB2HeaderFill(&Packet->Header, SMB2_CREATE, Total, Details);
  Packet->StructureSize = SMB2_CREATE_STRUCTURE_SIZE;
  Packet->SecurityFlags = Access->SecurityFlags;
  Packet->RequestedOplockLevel = Access->RequestedOplockLevel;
  Packet->ImpersonationLevel = Access->ImpersonationLevel;
  Packet->SmbCreateFlags = Access->SmbCreateFlags;
  Packet->DesiredAccess = Access->DesiredAccess;
  Packet->FileAttributes = Access->FileAttributes;
  Packet->ShareAccess = Access->ShareAccess;
  Packet->CreateDisposition = Access->CreateDisposition;
  Packet->CreateOptions = Access->CreateOptions;
  Packet->NameOffset = SMB2_CREATE_NAME_OFFSET;
  Packet->NameLength = static_cast<UINT16>(Characters * 2);
  Packet->CreateContextsLength = ContextsLength;
  *TotalBytes = Total;
  return EFI_SUCCESS;
}

UINT32 SMB2CreateRequest(SMB2_CREATE_REQUEST *Packet, TRANSACT_DETAILS *Details,
                         FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return SMB2_NT_INVALID_PARAMETER;
  }
  UINT8 *Name = nullptr;
  UINT32 NameSize = 0;
  UINT32 Total = 0;
  EFI_STATUS Status =
      SMB2CreateContextRequestPacketConstruct(Packet, Details, Access, &Name, &NameSize, &Total);
  if (EFI_ERROR(Status) || Total < sizeof(SMB2_CREATE_REQUEST)) {
    DiagError("SMB2CreatePacketConstruct failed!", Status);
    return SMB2ConstructFailureCode(Status);
  }
  // The contexts persist in the record, so a create that built none may
  // still find earlier ones there: what is copied is bounded by this
  // message's own CreateContextsLength. A durable context without a lease
  // context is counted but not copied; its bytes go out as zeros.
  UINT32 Room = Packet->CreateContextsLength;
  UINT32 LeaseBytes = 0;
  UINT32 DurableBytes = 0;
  if (Access->LeaseContextLength != 0) {
    LeaseBytes = Access->LeaseContextLength < Room ? Access->LeaseContextLength : Room;
    Room -= LeaseBytes;
    DurableBytes = Access->DurableContextLength < Room ? Access->DurableContextLength : Room;
  }
  const SMB2_SEND_PIECE Pieces[] = {
      {Packet, sizeof(*Packet)},
      {Name, NameSize},
      {Access->LeaseContext, LeaseBytes},
      {Access->DurableContext, DurableBytes},
  };
  SMB2TraceRequest(&Packet->Header, Total, 0);
  UINT32 Code = SMB2SendFileRequest(SockFd, Pieces, 4, Total, "Create");
  FreePool(Name);
  return Code;
}

EFI_STATUS SMB2VerifyCreateResponse(const SMB2_CREATE_RESPONSE *Packet,
                                    const TRANSACT_DETAILS *Details, FILE_ACCESS_DETAILS *Access) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  if (SMB2IsZeroFileId(Packet->Body.FileId)) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, CreateResp->FileId is 0! - 0x", __func__,
            __LINE__);
    for (UINTN I = 0; I < SMB2_FILE_ID_SIZE; I++) {
      Smb2Log(DIAG_ALWAYS, "%02x", Packet->Body.FileId[I]);
    }
    Smb2Log(DIAG_ALWAYS, "\n");
    return EFI_ACCESS_DENIED;
  }
  CopyMem(Access->FileId, Packet->Body.FileId, SMB2_FILE_ID_SIZE);
  LogCreateResponse(Packet->Body);
  return EFI_SUCCESS;
}

UINT32 SMB2CreateResponse(SMB2_CREATE_RESPONSE *Packet, TRANSACT_DETAILS *Details,
                          FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return SMB2_NT_INVALID_PARAMETER;
  }
  UINT32 Code = SMB2ReadResponseStart(SockFd, &Packet->Header, &Packet->Body, sizeof(Packet->Body));
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  // The contexts are not interpreted: they, and any padding the message
  // announces, are consumed. They must fit in what the message announces.
  UINT64 Rest = SMB2BodyLength(&Packet->Header) - sizeof(Packet->Body);
  UINT32 ContextsLength = Packet->Body.CreateContextsLength;
  if (ContextsLength == 0) {
    Smb2Log(DIAG_MISMATCH, "CreateResp->CreateContextsLength is 0!\n");
  } else if (ContextsLength > Rest) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, CreateContextsLength %u is beyond the %ld bytes the "
            "response holds!\n",
            __func__, __LINE__, ContextsLength, static_cast<INT64>(Rest));
    SMB2DrainMessageRest(SockFd, &Packet->Header, sizeof(Packet->Body));
    return STATUS_UNSUCCESSFUL;
  }
  Code = SMB2DrainMessageRest(SockFd, &Packet->Header, sizeof(Packet->Body));
  if (Code == STATUS_NO_MEMORY) {
    return SMB2_NT_OUT_OF_MEMORY;
  }
  if (Code != SMB2_NT_SUCCESS) {
    return Details->TransportStatus != 0 ? Details->TransportStatus : Code;
  }
  EFI_STATUS Status = SMB2VerifyCreateResponse(Packet, Details, Access);
  if (Status == EFI_SECURITY_VIOLATION) {
    return STATUS_LOGON_FAILURE;
  }
  return EFI_ERROR(Status) ? STATUS_UNSUCCESSFUL : SMB2_NT_SUCCESS;
}

EFI_STATUS SMB2_Open(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     FILE_ACCESS_DETAILS *Access) {
  DiagEntry(DiagChannel::Smb2);
  if (Share == nullptr || Session == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_CREATE_REQUEST Request;
  SMB2_CREATE_RESPONSE Response;
  EFI_STATUS Status = SMB2RunFileOperation(
      Access, [&] { return SMB2CreateRequest(&Request, &TransactDetails, Access, gSMB2SockFd); },
      "SMB2CreateRequest",
      [&] { return SMB2CreateResponse(&Response, &TransactDetails, Access, gSMB2SockFd); },
      "SMB2CreateResponse");
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_FILE_OPEN;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

// ---------------------------------------------------------------------------
// CLOSE
// ---------------------------------------------------------------------------
EFI_STATUS SMB2ClosePacketConstruct(SMB2_CLOSE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  SMB2HeaderFill(&Packet->Header, SMB2_CLOSE, sizeof(*Packet), Details);
  Packet->StructureSize = SMB2_CLOSE_STRUCTURE_SIZE;
  Packet->Flags = Access->SecurityFlags;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  return EFI_SUCCESS;
}

UINT32 SMB2CloseRequest(SMB2_CLOSE_REQUEST *Packet, TRANSACT_DETAILS *Details,
                        FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  EFI_STATUS Status = SMB2ClosePacketConstruct(Packet, Details, Access);
  if (EFI_ERROR(Status)) {
    return SMB2_NT_INVALID_PARAMETER;
  }
  const SMB2_SEND_PIECE Piece = {Packet, sizeof(*Packet)};
  SMB2TraceRequest(&Packet->Header, sizeof(*Packet), 0);
  return SMB2SendFileRequest(SockFd, &Piece, 1, sizeof(*Packet), "Close");
}

UINT32 SMB2CloseResponse(SMB2_CLOSE_REQUEST *Packet, TRANSACT_DETAILS *Details,
                         FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr) {
    LogNull(__func__, __LINE__);
    return SMB2_NT_INVALID_PARAMETER;
  }
  // The 60-byte body is read and its content ignored.
  constexpr UINT32 kCloseResponseBody = 60;
  UINT8 Body[kCloseResponseBody];
  SMB2_HEADER Header;
  UINT32 Code = SMB2ReadResponseStart(SockFd, &Header, Body, sizeof(Body));
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  return SMB2DrainMessageRest(SockFd, &Header, sizeof(Body));
}

EFI_STATUS SMB2_Close(FILE_ACCESS_DETAILS *Access) {
  DiagEntry(DiagChannel::Smb2);
  if (Access == nullptr) {
    LogNull(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  SMB2_CLOSE_REQUEST Request;
  EFI_STATUS Status = SMB2RunFileOperation(
      Access, [&] { return SMB2CloseRequest(&Request, &TransactDetails, Access, gSMB2SockFd); },
      "SMB2CloseRequest",
      [&] { return SMB2CloseResponse(&Request, &TransactDetails, Access, gSMB2SockFd); },
      "SMB2CloseResponse");
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_FILE_CLOSED;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
