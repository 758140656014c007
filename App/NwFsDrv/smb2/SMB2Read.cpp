// SMB2 READ: the encoder, where the data of the answer goes, and the
// decoder.
//
// Read data is received straight into the caller's buffer, and never more
// than the request's Length: a DataOffset inside the fixed body, or data
// beyond what was asked for or beyond what the answer announces, is refused
// before a byte of data is taken.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2FileAccess.h"

namespace {

UINT32 EncodeRead(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_READ_REQUEST *Packet = &File->Packet.Read;
  UINT32 Total = 0;
  UINT32 Code = SMB2ConstructResult(
      SMB2ReadPacketConstruct(Packet, Details, File->Access, &File->Allocated, &Total),
      "SMB2ReadPacketConstruct failed!", "SMB2ReadRequest");
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  SMB2LayRequest(Request, Packet, sizeof(*Packet), Total);
  SMB2AddPiece(Request, File->Allocated, Total - sizeof(*Packet));
  Request->DataLength = Packet->Length;
  Request->Offset = Packet->Offset;
  return SMB2_NT_SUCCESS;
}

// The data lies at DataOffset (from the SMB2 header), which must be at or
// after the end of the fixed body; it must fit both what the answer holds
// and what was asked for.
UINT32 PlaceReadData(void *Context, const SMB2_RESPONSE *Answer, SMB2_PLACEMENT *Placement) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_READ_RESPONSE_BODY Body;
  CopyMem(&Body, Answer->Fixed, sizeof(Body));
  UINT64 FixedEnd = SMB2_HEADER_STRUCTURE_SIZE + Answer->FixedLength;
  UINT64 Announced = Answer->BodyLength - Answer->FixedLength;
  UINT32 Asked = File->Access->ReadWriteInfo.Length;
  Smb2Log(DIAG_VERBOSE, "DataLength = %d, DataRemaining = %d\n", Body.DataLength,
          Body.DataRemaining);
  if (Body.DataLength == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, No file data to read\n", "SMB2ReadResponse",
            __LINE__);
    return SMB2_NT_SUCCESS;
  }
  if (Body.DataOffset < FixedEnd || Body.DataOffset - FixedEnd + Body.DataLength > Announced) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, DataOffset 0x%x and DataLength %u lie outside the %ld "
            "bytes that follow!\n",
            "SMB2ReadResponse", __LINE__, Body.DataOffset, Body.DataLength,
            static_cast<INT64>(Announced));
    return STATUS_UNSUCCESSFUL;
  }
  if (Body.DataLength > Asked) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, DataLength %u is beyond the %u bytes asked for!\n",
            "SMB2ReadResponse", __LINE__, Body.DataLength, Asked);
    return STATUS_UNSUCCESSFUL;
  }
  Placement->Skip = static_cast<UINT32>(Body.DataOffset - FixedEnd);
  Placement->Destination = File->Data;
  Placement->Length = Body.DataLength;
  return SMB2_NT_SUCCESS;
}

// An answer without data leaves BytesRead as the caller set it.
UINT32 DecodeRead(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  if (Answer->PlacedLength != 0) {
    File->Access->ReadWriteInfo.BytesRead = Answer->PlacedLength;
  }
  return SMB2_NT_SUCCESS;
}

const SMB2_RECEIVE_TEXTS kReadTexts = {
    "SMB2ReadVerifyHeader failed!",
    nullptr,
    nullptr,
    DIAG_ALWAYS,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = %ld\n",
    true,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Probably poll timed out. "
    "Status = 0x%x\n",
};

} // namespace

const SMB2_COMMAND gSMB2ReadCommand = {
    SMB2_READ,
    0,
    sizeof(SMB2_READ_RESPONSE_BODY),
    0,
    "SMB2ReadRequest",
    "SMB2ReadResponse",
    "Read request send failed!",
    &kReadTexts,
    EncodeRead,
    PlaceReadData,
    DecodeRead,
};

EFI_STATUS SMB2ReadPacketConstruct(SMB2_READ_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                   FILE_ACCESS_DETAILS *Access, UINT8 **ChannelCopy,
                                   UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr || ChannelCopy == nullptr ||
      TotalBytes == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const SMB2_READ_WRITE_INFO &Rw = Access->ReadWriteInfo;
  Smb2Log(DIAG_VERBOSE, "sizeof (struct ReadReq) = 0x%x\n",
          static_cast<UINT32>(sizeof(SMB2_READ_REQUEST)));
  *ChannelCopy = nullptr;
  UINT32 ChannelLength = Rw.ChannelInfoLength;
  UINT32 Total = sizeof(SMB2_READ_REQUEST) + ChannelLength;
  if (!SMB2DialectWithoutChannels(Details->DialectRevision) && ChannelLength != 0 &&
      Rw.ChannelInfo != nullptr) {
    *ChannelCopy = static_cast<UINT8 *>(AllocateCopyPool(ChannelLength, Rw.ChannelInfo));
    if (*ChannelCopy == nullptr) {
      // Deliberately reported as an invalid parameter.
      SMB2PrintAllocFailure(__func__, __LINE__);
      return EFI_INVALID_PARAMETER;
    }
  } else if (ChannelLength == 0) {
    Smb2Log(DIAG_VERBOSE, "ReadChannelInfoLength is 0!\n");
  }
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_READ];
  Packet->Length = Rw.Length;
  Packet->Offset = Rw.FileOffset;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  Packet->MinimumCount = Rw.MinimumCount;
  Packet->Channel = Rw.Channel;
  Packet->RemainingBytes = Rw.RemainingBytes;
  Packet->ReadChannelInfoOffset = 0;
  Packet->ReadChannelInfoLength = ChannelLength;
  *TotalBytes = Total;
  return EFI_SUCCESS;
}
