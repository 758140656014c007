// SMB2 READ and WRITE: one request's worth of file data per call. The
// adapter cuts larger transfers into requests of at most 64512 bytes.
//
// Read data is received straight into the caller's buffer, and never more
// than the request's Length: a DataLength beyond what was asked for, or
// beyond what the message announces, is refused before a byte of data is
// taken.
#include "smb2/SMB2FileAccess.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwPlatform.h"
#include "smb2/TcpTransport.h"

namespace {

// Clears the per-request channel fields before each READ and WRITE.
void ClearChannelFields(FILE_ACCESS_DETAILS *Access) {
  Access->ReadWriteInfo.MinimumCount = 0;
  Access->ReadWriteInfo.Channel = 0;
  Access->ReadWriteInfo.RemainingBytes = 0;
  Access->ReadWriteInfo.ChannelInfoLength = 0;
  Access->ReadWriteInfo.ChannelFlags = 0;
}

bool DialectWithoutChannels(UINT16 Dialect) {
  return Dialect == SMB2_DIALECT_202 || Dialect == SMB2_DIALECT_210;
}

// The argument check shared by READ and WRITE, which also clears the
// per-request channel fields.
EFI_STATUS CheckTransfer(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                         const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access,
                         const void *Data, const CHAR8 *Function, UINT32 Line) {
  if (Share == nullptr || Session == nullptr || ChannelInfo == nullptr || Access == nullptr ||
      Data == nullptr) {
    DiagNullInput(DiagChannel::Smb2, Function, Line);
    return EFI_INVALID_PARAMETER;
  }
  ClearChannelFields(Access);
  return EFI_SUCCESS;
}

// Receives the 16-byte READ body. A first receive that stops inside the
// body has the rest placed at twice the count it delivered, deliberately so;
// the body area is sized for that.
UINT32 ReceiveReadBody(INT32 SockFd, SMB2_READ_RESPONSE *Packet) {
  constexpr INT64 kBody = sizeof(SMB2_READ_RESPONSE_BODY);
  INT64 Got = 0;
  INT32 Rx = TCP_PollAndReceiveMessage(SockFd, Packet->Raw, kBody, &Got);
  TransactDetails.TransportStatus = static_cast<UINT32>(Rx);
  if (Got > 0 && Got < kBody) {
    INT64 More = 0;
    Rx = SMB2ReceiveAll(SockFd, Packet->Raw + 2 * Got, static_cast<UINT64>(kBody - Got),
                        &TransactDetails, &More);
    Got = Rx == 0 ? kBody : Got;
  }
  if (Got != kBody) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = %ld\n",
            "SMB2ReadResponse", __LINE__, static_cast<INT64>(Rx));
    return Rx != 0 ? static_cast<UINT32>(Rx) : STATUS_UNSUCCESSFUL;
  }
  return SMB2_NT_SUCCESS;
}

} // namespace

// ---------------------------------------------------------------------------
// READ
// ---------------------------------------------------------------------------
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
  if (!DialectWithoutChannels(Details->DialectRevision) && ChannelLength != 0 &&
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
  SMB2HeaderFill(&Packet->Header, SMB2_READ, Total, Details, Rw.Length);
  Packet->StructureSize = SMB2_READ_STRUCTURE_SIZE;
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

UINT32 SMB2ReadRequest(SMB2_READ_REQUEST *Packet, TRANSACT_DETAILS *Details,
                       FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  UINT8 *Channel = nullptr;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2ReadPacketConstruct(Packet, Details, Access, &Channel, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2ReadPacketConstruct failed!", Status);
    return SMB2ConstructFailureCode(Status);
  }
  const SMB2_SEND_PIECE Pieces[] = {{Packet, sizeof(*Packet)}, {Channel, Total - sizeof(*Packet)}};
  SMB2TraceRequest(&Packet->Header, Packet->Length, Packet->Offset);
  UINT32 Code = SMB2SendFileRequest(SockFd, Pieces, Channel != nullptr ? 2 : 1, Total, "Read");
  FreePool(Channel);
  return Code;
}

UINT32 SMB2ReadResponse(SMB2_READ_RESPONSE *Packet, TRANSACT_DETAILS *Details,
                        FILE_ACCESS_DETAILS *Access, INT32 SockFd, void *Data) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr || Data == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  ZeroMem(Packet, sizeof(*Packet));
  UINT32 Code = SMB2ReadResponseStart(SockFd, &Packet->Header, Packet->Raw,
                                      sizeof(SMB2_READ_RESPONSE_BODY), false);
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  Code = ReceiveReadBody(SockFd, Packet);
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  // The data is taken to follow the fixed body directly (DataOffset is not
  // consulted); it must fit both what the message announces and what was
  // asked for.
  UINT64 Announced = SMB2BodyLength(&Packet->Header) - sizeof(SMB2_READ_RESPONSE_BODY);
  UINT32 DataLength = Packet->Body.DataLength;
  Smb2Log(DIAG_VERBOSE, "DataLength = %d, DataRemaining = %d\n", DataLength,
          Packet->Body.DataRemaining);
  if (DataLength > Announced || DataLength > Access->ReadWriteInfo.Length) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, DataLength %u is beyond the %ld bytes that follow or "
            "the %u bytes asked for!\n",
            __func__, __LINE__, DataLength, static_cast<INT64>(Announced),
            Access->ReadWriteInfo.Length);
    SMB2DrainMessageRest(SockFd, &Packet->Header, sizeof(SMB2_READ_RESPONSE_BODY));
    return STATUS_UNSUCCESSFUL;
  }
  if (DataLength == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, No file data to read\n", __func__,
            __LINE__);
    SMB2DrainMessageRest(SockFd, &Packet->Header, sizeof(SMB2_READ_RESPONSE_BODY));
    return SMB2_NT_SUCCESS;
  }
  INT64 Received = 0;
  INT32 Rx = SMB2ReceiveAll(SockFd, Data, DataLength, Details, &Received);
  Access->ReadWriteInfo.BytesRead = Received > 0 ? static_cast<UINT64>(Received) : 0;
  if (Rx != 0) {
    if (Rx == NwErrno::ETIMEDOUT_) {
      Smb2Log(DIAG_ALWAYS,
              "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Probably poll "
              "timed out. Status = 0x%x\n",
              __func__, __LINE__, Rx);
    }
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = %ld\n",
            __func__, __LINE__, static_cast<INT64>(STATUS_UNSUCCESSFUL));
    return STATUS_UNSUCCESSFUL;
  }
  UINT64 Consumed = sizeof(SMB2_READ_RESPONSE_BODY) + Access->ReadWriteInfo.BytesRead;
  if (SMB2BodyLength(&Packet->Header) > Consumed) {
    Smb2Log(DIAG_VERBOSE, "Reading pending bytes %ld\n",
            static_cast<INT64>(SMB2BodyLength(&Packet->Header) - Consumed));
    Code = SMB2DrainMessageRest(SockFd, &Packet->Header, Consumed);
    if (Code == STATUS_NO_MEMORY) {
      return SMB2_NT_OUT_OF_MEMORY;
    }
  }
  return Code;
}

EFI_STATUS SMB2_Read(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                     const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access, void *Data) {
  DiagEntry(DiagChannel::Smb2);
  EFI_STATUS Status = CheckTransfer(Share, Session, ChannelInfo, Access, Data, __func__, __LINE__);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  SMB2_READ_REQUEST Request;
  SMB2_READ_RESPONSE Response;
  // The share details' last status is deliberately left as the caller set
  // it: a read does not report the header's NT status there.
  Status = SMB2RunFileOperation(
      Access, [&] { return SMB2ReadRequest(&Request, &TransactDetails, Access, gSMB2SockFd); },
      "SMB2ReadRequest",
      [&] { return SMB2ReadResponse(&Response, &TransactDetails, Access, gSMB2SockFd, Data); },
      "SMB2ReadResponse");
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

// ---------------------------------------------------------------------------
// WRITE
// ---------------------------------------------------------------------------
EFI_STATUS SMB2WritePacketConstruct(SMB2_WRITE_REQUEST *Packet, const TRANSACT_DETAILS *Details,
                                    const FILE_ACCESS_DETAILS *Access, UINT32 *TotalBytes) {
  if (Packet == nullptr || Details == nullptr || Access == nullptr || TotalBytes == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const SMB2_READ_WRITE_INFO &Rw = Access->ReadWriteInfo;
  Smb2Log(DIAG_VERBOSE, "sizeof (struct WriteReq) = 0x%x\n",
          static_cast<UINT32>(sizeof(SMB2_WRITE_REQUEST)));
  bool NoChannels = DialectWithoutChannels(Details->DialectRevision);
  UINT16 ChannelLength = NoChannels ? 0 : static_cast<UINT16>(Rw.ChannelInfoLength);
  ZeroMem(Packet, sizeof(*Packet));
  UINT32 Total = sizeof(SMB2_WRITE_REQUEST) + Rw.Length + ChannelLength;
  SMB2HeaderConstruct(&Packet->Header);
  SMB2HeaderFill(&Packet->Header, SMB2_WRITE, Total, Details, Rw.Length);
  Packet->StructureSize = SMB2_WRITE_STRUCTURE_SIZE;
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

UINT32 SMB2WriteRequest(SMB2_WRITE_REQUEST *Packet, TRANSACT_DETAILS *Details,
                        FILE_ACCESS_DETAILS *Access, INT32 SockFd, const void *Data) {
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2WritePacketConstruct(Packet, Details, Access, &Total);
  if (EFI_ERROR(Status) || Data == nullptr) {
    DiagError("SMB2WritePacketConstruct failed!", Status);
    return SMB2_NT_INVALID_PARAMETER;
  }
  // Header and data go out as one contiguous message; channel-info bytes,
  // never used by this client, go out as zeros.
  const SMB2_SEND_PIECE Pieces[] = {{Packet, sizeof(*Packet)}, {Data, Packet->Length}};
  SMB2TraceRequest(&Packet->Header, Packet->Length, Packet->Offset);
  UINT32 Code = SMB2SendFileRequest(SockFd, Pieces, 2, Total, "Write");
  Access->ReadWriteInfo.BytesWritten =
      Code == SMB2_NT_SUCCESS ? Total - static_cast<UINT32>(sizeof(*Packet)) : 0;
  Smb2Log(DIAG_VERBOSE, "Bytes written = %ld\n",
          static_cast<INT64>(Access->ReadWriteInfo.BytesWritten));
  return Code;
}

UINT32 SMB2WriteResponse(TRANSACT_DETAILS *Details, FILE_ACCESS_DETAILS *Access, INT32 SockFd) {
  if (Details == nullptr || Access == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  // Count is not compared with what was sent: a complete answer with a
  // good header is success.
  SMB2_HEADER Header;
  SMB2_WRITE_RESPONSE_BODY Body;
  UINT32 Code = SMB2ReadResponseStart(SockFd, &Header, &Body, sizeof(Body));
  if (Code != SMB2_NT_SUCCESS) {
    return Code;
  }
  return SMB2DrainMessageRest(SockFd, &Header, sizeof(Body));
}

EFI_STATUS SMB2_Write(SMB2ShareDetails *Share, SMB2_CLIENT_SESSION *Session,
                      const QUERY_DETAILS *ChannelInfo, FILE_ACCESS_DETAILS *Access,
                      const void *Data) {
  DiagEntry(DiagChannel::Smb2);
  EFI_STATUS Status = CheckTransfer(Share, Session, ChannelInfo, Access, Data, __func__, __LINE__);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  SMB2_WRITE_REQUEST Request;
  Status = SMB2RunFileOperation(
      Access,
      [&] { return SMB2WriteRequest(&Request, &TransactDetails, Access, gSMB2SockFd, Data); },
      "SMB2WriteRequest", [&] { return SMB2WriteResponse(&TransactDetails, Access, gSMB2SockFd); },
      "SMB2WriteResponse");
  Share->LastStatus = TransactDetails.ResponseStatus;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
