// SMB2 QUERY_INFO and the verification that stores an information answer
// into FileAccessDetails (also used for directory answers).
//
// Ownership of the directory answer copies: DirInfoPtr and FullDirInfoPtr
// belong to FileAccessDetails. Storing a new copy releases the one it
// replaces; the listing walk releases FullDirInfoPtr once it has turned it
// into nodes (whatever the walk's outcome); the adapter releases whatever is
// left when it lets go of the record (disconnect and initialisation). A copy
// therefore never outlives the record and never leaks when replaced.
#include "smb2/SMB2FileAccess.h"

#include "DiagLog.h"
#include "NwBaseLib.h"

namespace {

// A fixed-size class copies Size bytes of the answer to Destination.
struct INFO_CLASS_COPY {
  UINT8 InfoType;
  UINT8 Class;
  UINTN Offset; // within FILE_ACCESS_DETAILS
  UINT32 Size;
};

constexpr UINTN kImage = offsetof(FILE_ACCESS_DETAILS, FileInfo);
constexpr INFO_CLASS_COPY kFixedClasses[] = {
    {SMB2_INFO_FILE, FILE_BASIC_INFORMATION, kImage, 40},
    {SMB2_INFO_FILE, FILE_STANDARD_INFORMATION,
     kImage + offsetof(SMB2_FILE_INFO_IMAGE, AllocationSize), 24},
    {SMB2_INFO_FILE, FILE_INTERNAL_INFORMATION, offsetof(FILE_ACCESS_DETAILS, IndexNumber), 8},
    {SMB2_INFO_FILE, FILE_ACCESS_INFORMATION, offsetof(FILE_ACCESS_DETAILS, AccessFlags), 4},
    {SMB2_INFO_FILE, FILE_ALL_INFORMATION, kImage, sizeof(SMB2_FILE_INFO_IMAGE)},
    {SMB2_INFO_FILE, FILE_END_OF_FILE_INFORMATION,
     kImage + offsetof(SMB2_FILE_INFO_IMAGE, EndOfFile), 8},
    {SMB2_INFO_FILESYSTEM, FILE_FS_SIZE_INFORMATION, offsetof(FILE_ACCESS_DETAILS, FsSize),
     sizeof(SMB2_FS_SIZE_INFO)},
};
static_assert(kImage + offsetof(SMB2_FILE_INFO_IMAGE, AllocationSize) + 24 <=
                  offsetof(FILE_ACCESS_DETAILS, IndexNumber),
              "standard information stays inside the image");

const INFO_CLASS_COPY *FindFixedClass(UINT8 InfoType, UINT8 Class) {
  for (const INFO_CLASS_COPY &Entry : kFixedClasses) {
    if (Entry.InfoType == InfoType && Entry.Class == Class) {
      return &Entry;
    }
  }
  return nullptr;
}

// Makes a copy of a directory answer with a zeroed tail. A failed
// allocation is reported and deliberately not treated as a failure of the
// query: the copy is then absent.
UINT8 *CopyDirectoryAnswer(const UINT8 *Output, UINT32 Length) {
  UINT8 *Copy =
      static_cast<UINT8 *>(AllocateZeroPool(static_cast<UINTN>(Length) + SMB2_DIR_INFO_SLACK));
  if (Copy == nullptr) {
    SMB2PrintAllocFailure("SMB2VerifyInfoStructure", __LINE__);
    return nullptr;
  }
  CopyMem(Copy, Output, Length);
  return Copy;
}

EFI_STATUS RefuseClass(FILE_ACCESS_DETAILS *Access, const CHAR8 *Message, UINT8 Value,
                       UINT32 Line) {
  Smb2Log(DIAG_ALWAYS, Message, "SMB2VerifyInfoStructure", Line, Value);
  Access->RawFileInfo = nullptr;
  return EFI_NOT_FOUND;
}

} // namespace

EFI_STATUS SMB2VerifyInfoStructure(const SMB2_QUERY_RESPONSE *Packet, UINT8 *Output,
                                   const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access) {
  if (Packet == nullptr || Output == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  Access->RawFileInfo = Output;
  UINT32 Length = Packet->Body.OutputBufferLength;
  if (Query->InfoType == SMB2_INFO_FILE && Query->FileInfoClass == FILE_DIRECTORY_INFORMATION) {
    // A new copy replaces (and releases) the one before it.
    FreePool(Access->DirInfoPtr);
    Access->DirInfoPtr = CopyDirectoryAnswer(Output, Length);
    Access->DirInfoLength = Access->DirInfoPtr != nullptr ? Length : 0;
    return EFI_SUCCESS;
  }
  if (Query->InfoType == SMB2_INFO_FILE &&
      Query->FileInfoClass == FILE_FULL_DIRECTORY_INFORMATION) {
    FreePool(Access->FullDirInfoPtr);
    Access->FullDirInfoPtr = CopyDirectoryAnswer(Output, Length);
    Access->FullDirInfoLength = Access->FullDirInfoPtr != nullptr ? Length : 0;
    if (Length >= SMB2_FULL_DIR_NAME) {
      Smb2Log(DIAG_VERBOSE, "NextEntryOffset = %d, FileNameLength = %d\n",
              SMB2ReadLe32(Output + SMB2_FULL_DIR_NEXT_OFFSET),
              SMB2ReadLe32(Output + SMB2_FULL_DIR_NAME_LENGTH));
    }
    return EFI_SUCCESS;
  }
  if (Query->InfoType != SMB2_INFO_FILE && Query->InfoType != SMB2_INFO_FILESYSTEM) {
    return RefuseClass(Access,
                       "Function: %s, Line no.: = %d, Other InfoTypes not checked - 0x%x "
                       "detected! \n",
                       Query->InfoType, __LINE__);
  }
  const INFO_CLASS_COPY *Copy = FindFixedClass(Query->InfoType, Query->FileInfoClass);
  if (Copy == nullptr) {
    return RefuseClass(Access,
                       "Function: %s, Line no.: = %d, Other FileInfoClasses not checked - 0x%x "
                       "detected! \n",
                       Query->FileInfoClass, __LINE__);
  }
  // The fixed byte counts are taken as they stand, but never from beyond
  // the answer: a short answer is refused and leaves the fields unchanged.
  if (Length < Copy->Size) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Output buffer length %u is shorter than the %u bytes "
            "of class %d!\n",
            __func__, __LINE__, Length, Copy->Size, Query->FileInfoClass);
    Access->RawFileInfo = nullptr;
    return EFI_PROTOCOL_ERROR;
  }
  CopyMem(reinterpret_cast<UINT8 *>(Access) + Copy->Offset, Output, Copy->Size);
  return EFI_SUCCESS;
}

UINT32 SMB2ReadQueryResponse(INT32 SockFd, SMB2_QUERY_RESPONSE *Packet, const QUERY_DETAILS *Query,
                             FILE_ACCESS_DETAILS *Access, const SMB2_QUERY_ANSWER_TEXTS &Texts,
                             const CHAR8 *Function, UINT32 Line) {
  constexpr UINT32 kFixed = sizeof(SMB2_QUERY_RESPONSE_BODY);
  UINT32 Code =
      SMB2ReadResponseStart(SockFd, &Packet->Header, &Packet->Body, kFixed, true, Function, Line);
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  UINT32 Length = Packet->Body.OutputBufferLength;
  const UINT32 Limit = Texts.Limit;
  if (Length == 0) {
    Smb2Log(DIAG_ALWAYS, "%s", Texts.Empty);
    return SMB2DrainMessageRest(SockFd, &Packet->Header, kFixed);
  }
  UINT64 Announced = SMB2BodyLength(&Packet->Header) - kFixed;
  if (Length > Announced || Length > Limit) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, OutputBufferLength %u is beyond the %ld bytes that "
            "follow or the %u bytes asked for!\n",
            Function, Line, Length, static_cast<INT64>(Announced), Limit);
    SMB2DrainMessageRest(SockFd, &Packet->Header, kFixed);
    return STATUS_UNSUCCESSFUL;
  }
  UINT8 *Output = static_cast<UINT8 *>(AllocateZeroPool(static_cast<UINTN>(Length) + 1));
  if (Output == nullptr) {
    SMB2PrintAllocFailure(Function, Line);
    SMB2DrainMessageRest(SockFd, &Packet->Header, kFixed);
    return SMB2_NT_OUT_OF_MEMORY;
  }
  INT32 Rx = SMB2ReceiveAll(SockFd, Output, Length, &TransactDetails);
  if (Rx != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_PollAndTryToRxAllData failed! Status = %ld\n",
            Function, Line, static_cast<INT64>(Rx));
    Code = static_cast<UINT32>(Rx);
  } else {
    Code = SMB2DrainMessageRest(SockFd, &Packet->Header, kFixed + static_cast<UINT64>(Length));
  }
  if (Code == SMB2_NT_SUCCESS) {
    EFI_STATUS Status = SMB2VerifyInfoStructure(Packet, Output, Query, Access);
    if (Status == EFI_SECURITY_VIOLATION) {
      DiagError(Texts.LogonFailed, Status, Function, Line);
      Code = STATUS_LOGON_FAILURE;
    } else if (EFI_ERROR(Status)) {
      DiagError(Texts.Failed, Status, Function, Line);
      Code = STATUS_UNSUCCESSFUL;
    }
  }
  FreePool(Output);
  Access->RawFileInfo = nullptr;
  return Code;
}

EFI_STATUS SMB2QueryInfoPacketConstruct(SMB2_QUERY_INFO_REQUEST *Packet,
                                        const TRANSACT_DETAILS *Details, const QUERY_DETAILS *Query,
                                        const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Query == nullptr || Access == nullptr ||
      TotalBytes == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  Smb2Log(DIAG_VERBOSE, "sizeof (struct QueryInfoReq) = 0x%x\n",
          static_cast<UINT32>(sizeof(SMB2_QUERY_INFO_REQUEST)));
  UINT32 Total = sizeof(SMB2_QUERY_INFO_REQUEST) + Query->InputBufferLength;
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  SMB2HeaderFill(&Packet->Header, SMB2_QUERY_INFO, Total, Details);
  Packet->StructureSize = SMB2_QUERY_INFO_STRUCTURE_SIZE;
  Packet->InfoType = Query->InfoType;
  Packet->FileInfoClass = Query->FileInfoClass;
  Packet->OutputBufferLength = SMB2_QUERY_INFO_OUTPUT_LENGTH;
  // An empty input buffer is announced at offset 0, and a present one at
  // the buffer's place behind the fixed part: servers check the offset even
  // when the length is 0 (Samba refuses any other value with
  // STATUS_INVALID_PARAMETER), so no value derived from the stream length is
  // sent here.
  Packet->InputBufferOffset = Query->InputBufferLength == 0 ? 0 : SMB2_QUERY_INFO_INPUT_OFFSET;
  Packet->InputBufferLength = Query->InputBufferLength;
  Packet->AdditionalInformation = Query->AdditionalInformation;
  Packet->Flags = Query->Flags;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  *TotalBytes = Total;
  return EFI_SUCCESS;
}

UINT32 SMB2QueryInfoRequest(SMB2_QUERY_INFO_REQUEST *Packet, TRANSACT_DETAILS *Details,
                            const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2QueryInfoPacketConstruct(Packet, Details, Query, Access, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2QueryInfoPacketConstruct failed!", Status);
    return SMB2ConstructFailureCode(Status);
  }
  UINT32 InputLength = Query->Buffer != nullptr ? Query->InputBufferLength : 0;
  const SMB2_SEND_PIECE Pieces[] = {{Packet, sizeof(*Packet)}, {Query->Buffer, InputLength}};
  SMB2TraceRequest(&Packet->Header, Total, 0);
  return SMB2SendFileRequest(SockFd, Pieces, Query->InputBufferLength != 0 ? 2 : 1, Total,
                             "Query Info");
}

UINT32 SMB2QueryInfoResponse(SMB2_QUERY_RESPONSE *Packet, TRANSACT_DETAILS *Details,
                             const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access,
                             INT32 SockFd) {
  if (Packet == nullptr || Details == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  const SMB2_QUERY_ANSWER_TEXTS Texts = {
      SMB2_QUERY_INFO_OUTPUT_LENGTH, "QueryInfoResp->OutputBufferLength is 0!\n",
      "SMB2VerifyInfoStructure failed!", "SMB2VerifyInfoStructure logon failed!"};
  return SMB2ReadQueryResponse(SockFd, Packet, Query, Access, Texts);
}

EFI_STATUS SMB2_FSInfo(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                       const QUERY_DETAILS *Query, FILE_ACCESS_DETAILS *Access) {
  DiagEntry(DiagChannel::Smb2);
  if (Share == nullptr || Session == nullptr || Query == nullptr || Access == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SMB2_QUERY_INFO_REQUEST Request;
  SMB2_QUERY_RESPONSE Response;
  EFI_STATUS Status = SMB2RunFileOperation(
      Access,
      [&] { return SMB2QueryInfoRequest(&Request, &TransactDetails, Query, Access, gSMB2SockFd); },
      "SMB2QueryInfoRequest",
      [&] {
        return SMB2QueryInfoResponse(&Response, &TransactDetails, Query, Access, gSMB2SockFd);
      },
      "SMB2QueryInfoResponse");
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
