// SMB2 framing: header construction, message sequencing fields, the
// response-header check and read, the send loop and the NT-code mapping.
#include "smb2/SMB2Header.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "NwPlatform.h"
#include "smb2/TcpTransport.h"

INT32 gSMB2SockFd;
TRANSACT_DETAILS TransactDetails;
UINT8 SMB2ConnectionState;

namespace {

constexpr UINT8 kProtocolId[4] = {0xFE, 'S', 'M', 'B'};
constexpr UINT64 kDrainChunk = 512;

UINT32 ByteSwap32(UINT32 Value) {
  return (Value >> 24) | ((Value >> 8) & 0xFF00) | ((Value << 8) & 0xFF0000) | (Value << 24);
}

void DumpHeaderBytes(const UINT8 *Bytes, UINT32 Length) {
  for (UINT32 I = 0; I < Length; I++) {
    Smb2Log(DIAG_ALWAYS, "BufPtr[%d] = 0x%x\n", I, Bytes[I]);
  }
}

} // namespace

UINT32 SMB2StreamLength(const SMB2_HEADER *Header) {
  return ByteSwap32(Header->StreamProtocolLength);
}

void SMB2SetStreamLength(SMB2_HEADER *Header, UINT32 TotalLength) {
  Header->StreamProtocolLength = ByteSwap32(TotalLength - SMB2_STREAM_PREFIX_SIZE);
}

UINT32 SMB2BodyLength(const SMB2_HEADER *Header) {
  UINT32 Stream = SMB2StreamLength(Header);
  return Stream > SMB2_HEADER_STRUCTURE_SIZE ? Stream - SMB2_HEADER_STRUCTURE_SIZE : 0;
}

EFI_STATUS SMB2HeaderConstruct(void *Buffer) {
  if (Buffer == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  SMB2_HEADER *Header = static_cast<SMB2_HEADER *>(Buffer);
  ZeroMem(Header, sizeof(*Header));
  CopyMem(Header->ProtocolId, kProtocolId, sizeof(kProtocolId));
  Header->StructureSize = SMB2_HEADER_STRUCTURE_SIZE;
  Header->CreditCharge = 0;
  Header->CreditRequest = SMB2_CREDIT_REQUEST;
  return EFI_SUCCESS;
}

UINT16 SMB2CreditCharge(UINT16 Command, UINT32 Length, UINT16 Dialect) {
  if (Dialect == SMB2_DIALECT_202) {
    return 0;
  }
  switch (Command) {
  case SMB2_TREE_CONNECT:
  case SMB2_CREATE:
  case SMB2_CLOSE:
  case SMB2_QUERY_DIRECTORY:
  case SMB2_QUERY_INFO:
    return 1;
  case SMB2_READ:
  case SMB2_WRITE:
    // One credit per started 64 KiB, computed in 32 bits and stored in 16:
    // a length of 0 gives 0x10000, which the field holds as 0.
    return static_cast<UINT16>(((Length - 1) >> 16) + 1);
  default:
    return 0;
  }
}

void SMB2HeaderFill(SMB2_HEADER *Header, UINT16 Command, UINT32 TotalLength,
                    const TRANSACT_DETAILS *Details, UINT32 DataLength) {
  SMB2SetStreamLength(Header, TotalLength);
  Header->Command = Command;
  Header->CreditCharge = SMB2CreditCharge(Command, DataLength, Details->DialectRevision);
  Header->MessageId = Command == SMB2_NEGOTIATE ? 0 : Details->MessageId;
  bool CarriesTree =
      Command != SMB2_NEGOTIATE && Command != SMB2_SESSION_SETUP && Command != SMB2_TREE_CONNECT;
  Header->TreeId = CarriesTree ? Details->TreeId : 0;
  Header->SessionId = Command == SMB2_NEGOTIATE ? 0 : Details->SessionId;
}

UINT32 SMB2SendAll(INT32 SockFd, const UINT8 *Bytes, UINT64 Length, UINT32 *TransportStatus) {
  if (Bytes == nullptr || TransportStatus == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  if (Length == 0) {
    DiagError("Error! Bytes to be sent is zero!", EFI_INVALID_PARAMETER);
    return STATUS_UNSUCCESSFUL;
  }
  UINT64 Offset = 0;
  INT32 Status = 0;
  while (Offset < Length) {
    INT64 Sent = 0;
    Status =
        TCP_PollAndSendMessage(SockFd, Bytes + Offset, static_cast<INT64>(Length - Offset), &Sent);
    if (Status == 0 && Sent <= 0) {
      Status = -1; // a send that moves nothing would never finish
    }
    *TransportStatus = static_cast<UINT32>(Status);
    if (Status != 0) {
      Smb2Log(DIAG_ALWAYS,
              "Function: %s, Line no.: = %d, TCP_SendMessage failed! Status = 0x%x, Bytes sent "
              "= %ld\n",
              "SMB2SendRequest", __LINE__, Status, static_cast<INT64>(Offset));
      break;
    }
    Offset += static_cast<UINT64>(Sent);
  }
  if (Status == 0) {
    Smb2Log(DIAG_VERBOSE, "All bytes %ld written!\n", static_cast<INT64>(Offset));
  }
  return static_cast<UINT32>(Status);
}

EFI_STATUS SMB2VerifyHeader(const SMB2_HEADER *Header, TRANSACT_DETAILS *Details) {
  if (Header == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  Smb2Log(DIAG_VERBOSE, "Verifying the Response header\n");
  EFI_STATUS Status = EFI_SUCCESS;
  for (UINT32 I = 0; I < sizeof(kProtocolId); I++) {
    if (Header->ProtocolId[I] != kProtocolId[I]) {
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Header check failed!\n", __func__,
              __LINE__);
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, ProtocolId[%d] = 0x%x\n", __func__,
              __LINE__, I, kProtocolId[I]);
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Header->ProtocolId[%d] = 0x%x\n",
              __func__, __LINE__, I, Header->ProtocolId[I]);
      Status = EFI_SECURITY_VIOLATION;
      break;
    }
  }
  Details->ResponseStatus = Header->Status;
  if (Header->Status == SMB2_NT_SUCCESS) {
    if (Header->MessageId != Details->MessageId) {
      Smb2Log(DIAG_ALWAYS, "Response Message Id is incorrect! Id = 0x%x, Expected = 0x%x\n",
              static_cast<UINT32>(Header->MessageId), static_cast<UINT32>(Details->MessageId));
      Status = EFI_SECURITY_VIOLATION;
    }
  } else if (Header->Status == STATUS_MORE_PROCESSING_REQUIRED) {
    // Deliberately overrides the protocol-id verdict: a continuation
    // response is accepted whatever its protocol id and message id.
    Status = EFI_SUCCESS;
  } else {
    Smb2Log(DIAG_ALWAYS, "%s: Response Status returned error! Status = 0x%x\n", "SMB2VerifyHeader",
            Header->Status);
    Status = EFI_SECURITY_VIOLATION;
  }
  return Status;
}

INT32 SMB2ReceiveAll(INT32 SockFd, void *Buffer, UINT64 Length, TRANSACT_DETAILS *Details,
                     INT64 *Received) {
  INT64 Got = 0;
  INT32 Result = TCP_PollAndTryToRxAllData(SockFd, Buffer, static_cast<INT64>(Length),
                                           TCP_RX_LOOP_LIMIT, &Got);
  if (Details != nullptr) {
    Details->TransportStatus = static_cast<UINT32>(Result);
  }
  if (Received != nullptr) {
    *Received = Got;
  }
  if (Result == 0 && Got != static_cast<INT64>(Length)) {
    Result = -1;
  }
  return Result;
}

namespace {

// Reads and discards Length bytes in bounded pieces.
bool DrainBytes(INT32 SockFd, UINT64 Length, TRANSACT_DETAILS *Details) {
  UINT8 Scratch[kDrainChunk];
  while (Length > 0) {
    UINT64 Piece = Length < kDrainChunk ? Length : kDrainChunk;
    if (SMB2ReceiveAll(SockFd, Scratch, Piece, Details) != 0) {
      return false;
    }
    Length -= Piece;
  }
  return true;
}

// Answers the header read passes over on its way to the final one: interim
// answers (STATUS_PENDING says only that the final answer follows) and
// unsolicited notifications, each of a length a frame can have (any other is
// left to the out-of-step check).
bool IsSkippedAnswer(const SMB2_HEADER *Header, const TRANSACT_DETAILS *Details) {
  UINT32 Stream = SMB2StreamLength(Header);
  if (Stream < SMB2_HEADER_STRUCTURE_SIZE || Stream > SMB2_MAX_STREAM_LENGTH) {
    return false;
  }
  if (Header->MessageId == SMB2_NOTIFICATION_MESSAGE_ID) {
    return true;
  }
  return Header->Status == STATUS_PENDING && Header->MessageId == Details->MessageId;
}

UINT64 NowMicroseconds() {
  NwTimeVal Tv;
  ZeroMem(&Tv, sizeof(Tv));
  NwGetTimeOfDay(&Tv);
  return static_cast<UINT64>(Tv.tv_sec) * 1000000u + static_cast<UINT64>(Tv.tv_usec);
}

// Receives the header of the final answer, passing over skipped answers.
INT32 ReceiveFinalHeader(UINT8 *Buffer, TRANSACT_DETAILS *Details, INT32 SockFd, INT64 *BytesRead) {
  const SMB2_HEADER *Received = reinterpret_cast<const SMB2_HEADER *>(Buffer);
  INT32 Rx = SMB2ReceiveAll(SockFd, Buffer, SMB2_FRAMED_HEADER_SIZE, Details, BytesRead);
  UINT64 Since = 0;
  for (UINT32 Skipped = 0; Rx == 0 && IsSkippedAnswer(Received, Details); Skipped++) {
    UINT64 Now = NowMicroseconds();
    Since = Skipped == 0 ? Now : Since;
    if (Skipped == SMB2_MAX_INTERIM_RESPONSES || Now - Since > SMB2_ANSWER_TIME_LIMIT_US) {
      Smb2Log(DIAG_ALWAYS,
              "Function: %s, Line no.: = %d, No final answer after %d interim answers or "
              "notifications!\n",
              "SMB2ReadVerifyHeader", __LINE__, Skipped);
      return NwErrno::ETIMEDOUT_;
    }
    Smb2Log(DIAG_VERBOSE, "Interim response, waiting for the final one\n");
    if (!DrainBytes(SockFd, SMB2BodyLength(Received), Details)) {
      return -1;
    }
    Rx = SMB2ReceiveAll(SockFd, Buffer, SMB2_FRAMED_HEADER_SIZE, Details, BytesRead);
  }
  return Rx;
}

// A header that does not belong to this exchange where it stands in the
// stream: after it, the stream's framing cannot be trusted.
bool OutOfStep(const SMB2_HEADER *Header, const TRANSACT_DETAILS *Details, UINT16 Command) {
  const CHAR8 *Why = nullptr;
  UINT32 Stream = SMB2StreamLength(Header);
  // A continuation answer is taken whatever its protocol id and message id
  // (the session setup checks its message id itself).
  bool Continuation = Header->Status == STATUS_MORE_PROCESSING_REQUIRED;
  if (!Continuation && CompareMem(Header->ProtocolId, kProtocolId, sizeof(kProtocolId)) != 0) {
    Why = "ProtocolId";
  } else if (Header->StructureSize != SMB2_HEADER_STRUCTURE_SIZE) {
    Why = "StructureSize";
  } else if (Stream < SMB2_HEADER_STRUCTURE_SIZE || Stream > SMB2_MAX_STREAM_LENGTH) {
    Why = "StreamProtocolLength";
  } else if (!Continuation && Header->MessageId != Details->MessageId) {
    Why = "MessageId";
  } else if (Header->Command != Command) {
    Why = "Command";
  }
  if (Why == nullptr) {
    return false;
  }
  Smb2Log(DIAG_ALWAYS,
          "Function: %s, Line no.: = %d, Answer out of step: its %s does not fit the request "
          "(command 0x%x, message id 0x%lx)!\n",
          "SMB2ReadVerifyHeader", __LINE__, Why, Command, Details->MessageId);
  return true;
}

} // namespace

EFI_STATUS SMB2ReadVerifyHeader(SMB2_HEADER *Header, TRANSACT_DETAILS *Details, INT32 SockFd,
                                UINT16 Command) {
  if (Header == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  UINT8 Buffer[SMB2_FRAMED_HEADER_SIZE + 1] = {};
  SMB2_HEADER *Received = reinterpret_cast<SMB2_HEADER *>(Buffer);
  INT64 BytesRead = 0;
  INT32 Rx = ReceiveFinalHeader(Buffer, Details, SockFd, &BytesRead);
  if (Rx != 0) {
    // What arrived of a frame that broke off says nothing trustworthy: the
    // connection is given up, nothing more is read.
    Smb2Log(DIAG_ALWAYS, "%s (%d): Error in receiving the data! Status = %d, BytesRead = %lld\n",
            "SMB2ReadVerifyHeader", __LINE__, Rx, BytesRead);
    return EFI_PROTOCOL_ERROR;
  }
  Smb2Log(DIAG_VERBOSE, "Received all header bytes!\n");
  EFI_STATUS Status = SMB2VerifyHeader(Received, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifyHeader failed!", Status);
    DumpHeaderBytes(Buffer, SMB2_FRAMED_HEADER_SIZE);
  }
  if (OutOfStep(Received, Details, Command)) {
    return EFI_COMPROMISED_DATA;
  }
  CopyMem(Header, Buffer, SMB2_FRAMED_HEADER_SIZE);
  return Status;
}

void SMB2PrintAllocFailure(const CHAR8 *Function, UINT32 Line) {
  Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Memory allocation failed!\n", Function, Line);
}

EFI_STATUS SMB2MapNtStatus(UINT32 NtStatus, const CHAR8 *Callee, const CHAR8 *Function,
                           UINT32 Line) {
  if (NtStatus == SMB2_NT_SUCCESS) {
    return EFI_SUCCESS;
  }
  const CHAR8 *Ending;
  EFI_STATUS Status;
  if (NtStatus == STATUS_UNSUCCESSFUL) {
    Ending = "returned unsuccessful!";
    Status = EFI_DEVICE_ERROR;
  } else if (NtStatus == SMB2_NT_INVALID_PARAMETER) {
    Ending = "returned invalid parameter!";
    Status = EFI_INVALID_PARAMETER;
  } else {
    // A missing or wrong signature stays a security violation.
    Ending = "returned error!";
    Status = NtStatus == STATUS_INVALID_SIGNATURE ? EFI_SECURITY_VIOLATION : EFI_DEVICE_ERROR;
  }
  Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, %s %s Status = 0x%lx\n", Function, Line,
          Callee, Ending, static_cast<UINT64>(NtStatus));
  return Status;
}
