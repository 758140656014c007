// SMB2 CREATE: the encoder (the fixed part, the UTF-16 name and the create
// contexts) and the decoder (the file id).
//
// Ownership: the UTF-16 name buffer of a CREATE lives for one request. The
// lease and durable contexts stay referenced by FileAccessDetails after the
// request; a context replaces (and frees) the previous one of its kind, and
// SMB2FreeCreateContexts releases both when the adapter lets go of the
// record.
#include "smb2/SMB2FileAccess.h"

#include "DiagLog.h"
#include "NwBaseLib.h"

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
bool SMB2IsZeroFileId(const UINT8 *FileId) {
  for (UINTN I = 0; I < SMB2_FILE_ID_SIZE; I++) {
    if (FileId[I] != 0) {
      return false;
    }
  }
  return true;
}

UINT32 SMB2ConstructResult(EFI_STATUS Status, const CHAR8 *Failed, const CHAR8 *RequestName,
                           UINT32 Line) {
  if (!EFI_ERROR(Status)) {
    return SMB2_NT_SUCCESS;
  }
  DiagError(Failed, Status, RequestName, Line);
  if (Status == EFI_INVALID_PARAMETER) {
    return SMB2_NT_INVALID_PARAMETER;
  }
  return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
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
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_CREATE];
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

namespace {

UINT32 EncodeCreate(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  FILE_ACCESS_DETAILS *Access = File->Access;
  SMB2_CREATE_REQUEST *Packet = &File->Packet.Create;
  UINT32 NameSize = 0;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2CreateContextRequestPacketConstruct(Packet, Details, Access,
                                                              &File->Allocated, &NameSize, &Total);
  if (!EFI_ERROR(Status) && Total < sizeof(SMB2_CREATE_REQUEST)) {
    Status = EFI_INVALID_PARAMETER;
  }
  UINT32 Code =
      SMB2ConstructResult(Status, "SMB2CreatePacketConstruct failed!", "SMB2CreateRequest");
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
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
  SMB2LayRequest(Request, Packet, sizeof(*Packet), Total);
  SMB2AddPiece(Request, File->Allocated, NameSize);
  SMB2AddPiece(Request, Access->LeaseContext, LeaseBytes);
  SMB2AddPiece(Request, Access->DurableContext, DurableBytes);
  return SMB2_NT_SUCCESS;
}

// The contexts of the answer are not interpreted; they must lie within what
// the answer holds.
UINT32 DecodeCreate(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_CREATE_RESPONSE Packet;
  CopyMem(&Packet.Header, &Answer->Header, sizeof(Packet.Header));
  CopyMem(&Packet.Body, Answer->Fixed, sizeof(Packet.Body));
  UINT64 Rest = Answer->BodyLength - Answer->FixedLength;
  UINT32 ContextsLength = Packet.Body.CreateContextsLength;
  if (ContextsLength == 0) {
    Smb2Log(DIAG_MISMATCH, "CreateResp->CreateContextsLength is 0!\n");
  } else if (ContextsLength > Rest) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, CreateContextsLength %u is beyond the %ld bytes the "
            "response holds!\n",
            "SMB2CreateResponse", __LINE__, ContextsLength, static_cast<INT64>(Rest));
    return STATUS_UNSUCCESSFUL;
  }
  EFI_STATUS Status = SMB2VerifyCreateResponse(&Packet, &TransactDetails, File->Access);
  if (Status == EFI_SECURITY_VIOLATION) {
    return STATUS_LOGON_FAILURE;
  }
  return EFI_ERROR(Status) ? STATUS_UNSUCCESSFUL : SMB2_NT_SUCCESS;
}

} // namespace

const SMB2_COMMAND gSMB2CreateCommand = {
    SMB2_CREATE,
    0,
    sizeof(SMB2_CREATE_RESPONSE_BODY),
    0,
    "SMB2CreateRequest",
    "SMB2CreateResponse",
    "Create request send failed!",
    &gSMB2FileReceiveTexts,
    EncodeCreate,
    nullptr,
    DecodeCreate,
};
