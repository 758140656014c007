// SMB2 WRITE: the encoder (the fixed part followed by the data, in one
// message) and the decoder.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2FileAccess.h"

namespace {

UINT32 EncodeWrite(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_WRITE_REQUEST *Packet = &File->Packet.Write;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2WritePacketConstruct(Packet, Details, File->Access, &Total);
  if (EFI_ERROR(Status) || File->Data == nullptr) {
    DiagError("SMB2WritePacketConstruct failed!", Status, "SMB2WriteRequest", __LINE__);
    return SMB2_NT_INVALID_PARAMETER;
  }
  // Channel-info bytes, never used by this client, go out as zeros.
  SMB2LayRequest(Request, Packet, sizeof(*Packet), Total);
  SMB2AddPiece(Request, File->Data, Packet->Length);
  Request->DataLength = Packet->Length;
  Request->Offset = Packet->Offset;
  return SMB2_NT_SUCCESS;
}

// Count says how much of what was sent the server wrote: all of it, or a
// part (a short write, which the caller continues). None, or more than was
// sent, is no answer to this request.
UINT32 DecodeWrite(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_FILE_CONTEXT *File = static_cast<SMB2_FILE_CONTEXT *>(Context);
  SMB2_WRITE_RESPONSE_BODY Body;
  CopyMem(&Body, Answer->Fixed, sizeof(Body));
  UINT32 Sent = File->Packet.Write.Length;
  SMB2_READ_WRITE_INFO &Rw = File->Access->ReadWriteInfo;
  if (Body.Count > Sent || (Body.Count == 0 && Sent != 0)) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Count %u answers a WRITE of %u bytes!\n",
            "SMB2WriteResponse", __LINE__, Body.Count, Sent);
    return STATUS_UNSUCCESSFUL;
  }
  Rw.BytesWritten = Body.Count;
  Smb2Log(DIAG_VERBOSE, "Bytes written = %ld\n", static_cast<INT64>(Rw.BytesWritten));
  return SMB2_NT_SUCCESS;
}

} // namespace

const SMB2_COMMAND gSMB2WriteCommand = {
    SMB2_WRITE,
    0,
    sizeof(SMB2_WRITE_RESPONSE_BODY),
    0,
    "SMB2WriteRequest",
    "SMB2WriteResponse",
    "Write request send failed!",
    &gSMB2FileReceiveTexts,
    EncodeWrite,
    nullptr,
    DecodeWrite,
};

EFI_STATUS SMB2WritePacketConstruct(SMB2_WRITE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr || TotalBytes == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const SMB2_READ_WRITE_INFO &Rw = Access->ReadWriteInfo;
  Smb2Log(DIAG_VERBOSE, "sizeof (struct WriteReq) = 0x%x\n",
          static_cast<UINT32>(sizeof(SMB2_WRITE_REQUEST)));
  bool NoChannels = SMB2DialectWithoutChannels(Details->DialectRevision);
  UINT16 ChannelLength = NoChannels ? 0 : static_cast<UINT16>(Rw.ChannelInfoLength);
  ZeroMem(Packet, sizeof(*Packet));
  UINT32 Total = sizeof(SMB2_WRITE_REQUEST) + Rw.Length + ChannelLength;
  SMB2HeaderConstruct(&Packet->Header);
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_WRITE];
  Packet->DataOffset = SMB2_WRITE_DATA_OFFSET;
  Packet->Length = Rw.Length;
  Packet->Offset = Rw.FileOffset;
  CopyMem(Packet->FileId, Access->FileId, SMB2_FILE_ID_SIZE);
  Packet->Channel = NoChannels ? 0 : Rw.Channel;
  Packet->RemainingBytes = Rw.RemainingBytes;
  Packet->WriteChannelInfoOffset = 0;
  Packet->WriteChannelInfoLength = ChannelLength;
  Packet->Flags = 0;
  *TotalBytes = Total;
  return EFI_SUCCESS;
}
