// SMB2 QUERY_INFO: the encoder, the decoder, and the verification that
// stores an information answer into FileAccessDetails (also used for
// directory answers).
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

UINT32 EncodeQueryInfo(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_QUERY_INFO_REQUEST *Packet = &File->Packet.QueryInfo;
  UINT32 Total = 0;
  UINT32 Code = SMB2ConstructResult(
      SMB2QueryInfoPacketConstruct(Packet, Details, File->Query, File->Access, &Total),
      "SMB2QueryInfoPacketConstruct failed!", "SMB2QueryInfoRequest");
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  const QUERY_DETAILS *Query = File->Query;
  SMB2LayRequest(Request, Packet, sizeof(*Packet), Total);
  SMB2AddPiece(Request, Query->Buffer, Query->Buffer != nullptr ? Query->InputBufferLength : 0);
  return SMB2_NT_SUCCESS;
}

} // namespace

const SMB2_COMMAND gSMB2QueryInfoCommand = {
    SMB2_QUERY_INFO,
    0,
    sizeof(SMB2_QUERY_RESPONSE_BODY),
    SMB2_QUERY_INFO_OUTPUT_LENGTH + SMB2_QUERY_OUTPUT_PADDING,
    "SMB2QueryInfoRequest",
    "SMB2QueryInfoResponse",
    "Query Info request send failed!",
    &gSMB2FileReceiveTexts,
    EncodeQueryInfo,
    nullptr,
    SMB2DecodeQueryAnswer,
};

const SMB2_QUERY_ANSWER_TEXTS gSMB2QueryInfoTexts = {
    SMB2_QUERY_INFO_OUTPUT_LENGTH, "QueryInfoResp->OutputBufferLength is 0!\n",
    "SMB2VerifyInfoStructure failed!", "SMB2VerifyInfoStructure logon failed!",
    "SMB2QueryInfoResponse"};

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
              SMB2ReadLe32(Output + offsetof(SMB2_FULL_DIR_ENTRY, NextEntryOffset)),
              SMB2ReadLe32(Output + offsetof(SMB2_FULL_DIR_ENTRY, FileNameLength)));
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

UINT32 SMB2DecodeQueryAnswer(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  const SMB2_QUERY_ANSWER_TEXTS &Texts = *File->Answer;
  const QUERY_DETAILS *Query = File->Query;
  FILE_ACCESS_DETAILS *Access = File->Access;
  SMB2_QUERY_RESPONSE Packet;
  CopyMem(&Packet.Header, &Answer->Header, sizeof(Packet.Header));
  CopyMem(&Packet.Body, Answer->Fixed, sizeof(Packet.Body));
  UINT32 Length = Packet.Body.OutputBufferLength;
  if (Length == 0) {
    Smb2Log(DIAG_ALWAYS, "%s", Texts.Empty);
    return SMB2_NT_SUCCESS;
  }
  // The output lies at OutputBufferOffset (from the SMB2 header), at or
  // after the end of the fixed body and within what arrived.
  UINT64 Announced = Answer->BodyLength - Answer->FixedLength;
  if (Length > Announced || Length > Texts.Limit) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, OutputBufferLength %u is beyond the %ld bytes that "
            "follow or the %u bytes asked for!\n",
            Texts.Function, __LINE__, Length, static_cast<INT64>(Announced), Texts.Limit);
    return STATUS_UNSUCCESSFUL;
  }
  const UINT8 *Output = SMB2ResponseRange(Answer, Packet.Body.OutputBufferOffset, Length);
  if (Output == nullptr) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, OutputBufferOffset 0x%x lies outside the response!\n",
            Texts.Function, __LINE__, Packet.Body.OutputBufferOffset);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Code = SMB2_NT_SUCCESS;
  EFI_STATUS Status = SMB2VerifyInfoStructure(&Packet, const_cast<UINT8 *>(Output), Query, Access);
  if (Status == EFI_SECURITY_VIOLATION) {
    DiagError(Texts.LogonFailed, Status, Texts.Function, __LINE__);
    Code = STATUS_LOGON_FAILURE;
  } else if (EFI_ERROR(Status)) {
    DiagError(Texts.Failed, Status, Texts.Function, __LINE__);
    Code = STATUS_UNSUCCESSFUL;
  }
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
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_QUERY_INFO];
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
