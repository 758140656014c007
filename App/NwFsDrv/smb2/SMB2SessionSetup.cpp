// SESSION_SETUP: the first leg carries the NTLMSSP NEGOTIATE and must be
// answered with STATUS_MORE_PROCESSING_REQUIRED and a CHALLENGE; the second
// carries the AUTHENTICATE and must be answered with success. The tokens
// travel raw in the security buffer, without SPNEGO.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Session.h"

namespace {

// The first response's fixed part ends 72 bytes into the SMB2 message.
constexpr UINT32 kSetupFixedEnd = sizeof(SMB2_SESSION_SETUP_RESPONSE) - SMB2_STREAM_PREFIX_SIZE;
constexpr UINT64 kFirstSetupMessageId = 1;

// Builds and sends one SESSION_SETUP request around Blob.
UINT32 SendSetup(INT32 SockFd, const UINT8 *Blob, UINT16 BlobLength, TRANSACT_DETAILS *Details) {
  UINT8 *Packet = nullptr;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2SessionSetupPacketConstruct(Blob, BlobLength, Details, &Packet, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2SessionSetupPacketConstruct failed!", Status);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  return SMB2SendVerdict(SMB2SendAndFree(SockFd, Packet, Total, &Details->TransportStatus));
}

// Reads the rest of a message (after its fixed part) into a new pool
// buffer, refusing announcements larger than the client buffers.
UINT32 ReadRemainder(INT32 SockFd, UINT32 Remainder, TRANSACT_DETAILS *Details, UINT8 **Body) {
  *Body = nullptr;
  if (Remainder > SMB2_MAX_BUFFERED_BODY) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Response length 0x%x is too large!\n",
            __func__, __LINE__, Remainder);
    SMB2DrainBytes(SockFd, Remainder, Details);
    return STATUS_UNSUCCESSFUL;
  }
  UINT8 *Buffer = static_cast<UINT8 *>(AllocateZeroPool(Remainder + 1u));
  if (Buffer == nullptr) {
    SMB2PrintAllocFailure();
    return STATUS_NO_MEMORY;
  }
  if (Remainder != 0 && SMB2ReceiveAll(SockFd, Buffer, Remainder, Details) != 0) {
    SMB2PrintReceiveFailure(Details->TransportStatus);
    FreePool(Buffer);
    return STATUS_UNSUCCESSFUL;
  }
  *Body = Buffer;
  return SMB2_NT_SUCCESS;
}

// Where the security buffer of a response lies within the bytes after its
// fixed part; false when it does not lie there.
bool LocateSecurityBuffer(const SMB2_SESSION_SETUP_RESPONSE *Response, UINT32 StreamLength,
                          UINT32 *Start) {
  UINT32 Offset = Response->SecurityBufferOffset;
  UINT32 Length = Response->SecurityBufferLength;
  if (Length == 0) {
    *Start = 0;
    return true;
  }
  if (Offset < kSetupFixedEnd || static_cast<UINT64>(Offset) + Length > StreamLength) {
    Smb2Log(
        DIAG_ALWAYS,
        "Function: %s, Line no.: = %d, Security buffer (0x%x, 0x%x) lies outside the response!\n",
        __func__, __LINE__, Offset, Length);
    return false;
  }
  *Start = Offset - kSetupFixedEnd;
  return true;
}

} // namespace

EFI_STATUS SMB2SessionSetupPacketConstruct(const UINT8 *Blob, UINT16 BlobLength,
                                           TRANSACT_DETAILS *Details, UINT8 **Packet,
                                           UINT32 *Total) {
  if (Blob == nullptr || Details == nullptr || Packet == nullptr || Total == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  Details->SecurityBufferOffset = SMB2_SESSION_SETUP_BUFFER_OFFSET;
  Details->SecurityBufferLength = BlobLength;
  UINT32 Length = sizeof(SMB2_SESSION_SETUP_REQUEST) + Details->SecurityBufferLength;
  UINT8 *Buffer = static_cast<UINT8 *>(AllocateZeroPool(Length + 1u));
  if (Buffer == nullptr) {
    SMB2PrintAllocFailure();
    return EFI_OUT_OF_RESOURCES;
  }
  SMB2_SESSION_SETUP_REQUEST *Request = reinterpret_cast<SMB2_SESSION_SETUP_REQUEST *>(Buffer);
  SMB2HeaderConstruct(&Request->Header);
  SMB2HeaderFill(&Request->Header, SMB2_SESSION_SETUP, Length, Details);
  Request->StructureSize = SMB2_SESSION_SETUP_STRUCTURE_SIZE;
  Request->Flags = Details->Flags;
  Request->SecurityMode = Details->SecurityMode;
  Request->Capabilities = Details->Capabilities;
  Request->Channel = Details->Channel;
  Request->SecurityBufferOffset = Details->SecurityBufferOffset;
  Request->SecurityBufferLength = Details->SecurityBufferLength;
  Request->PreviousSessionId = 0;
  CopyMem(Buffer + sizeof(SMB2_SESSION_SETUP_REQUEST), Blob, BlobLength);
  Smb2Log(DIAG_VERBOSE, "SMB2_REQUEST_STRUCTURE_SIZE[SMB2_SESSION_SETUP] = 0x%x\n",
          Request->StructureSize);
  *Packet = Buffer;
  *Total = Length;
  return EFI_SUCCESS;
}

UINT32 SMB2SessionSetupRequest(INT32 SockFd, TRANSACT_DETAILS *Details) {
  if (Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  UINT8 Negotiate[sizeof(SMB2_NTLMSSP_NEGOTIATE_MESSAGE) + 1];
  UINT16 Length = 0;
  EFI_STATUS Status = SMB2NTLMSSPNegotiatePacketConstruct(Negotiate, &Length);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NTLMSSPNegotiatePacketConstruct failed!", Status);
    DiagError("SMB2SessionSetupPacketConstruct failed!", Status);
    return STATUS_UNSUCCESSFUL;
  }
  return SendSetup(SockFd, Negotiate, Length, Details);
}

UINT32 SMB2SessionChallengeResponse(INT32 SockFd, SMB2_SESSION_SETUP_RESPONSE *Response,
                                    TRANSACT_DETAILS *Details, UINT8 **Body,
                                    SMB2_NTLM_CHALLENGE *Challenge) {
  if (Response == nullptr || Details == nullptr || Body == nullptr || Challenge == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  *Body = nullptr;
  Challenge->Message = nullptr;
  Challenge->Length = 0;
  if (SMB2ReceiveAll(SockFd, Response, sizeof(*Response), Details) != 0) {
    SMB2PrintReceiveFailure(Details->TransportStatus);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 StreamLength = SMB2StreamLength(&Response->Header);
  UINT32 Remainder = StreamLength > kSetupFixedEnd ? StreamLength - kSetupFixedEnd : 0;
  EFI_STATUS Status = SMB2VerifyHeader(&Response->Header, Details);
  if (EFI_ERROR(Status)) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Session Setup response header check failed!\n", __func__,
            __LINE__);
    SMB2DrainRefused(SockFd, &Response->Header, kSetupFixedEnd - SMB2_HEADER_STRUCTURE_SIZE,
                     Details);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Start = 0;
  if (StreamLength < kSetupFixedEnd || !LocateSecurityBuffer(Response, StreamLength, &Start)) {
    SMB2DrainBytes(SockFd, Remainder, Details);
    return STATUS_UNSUCCESSFUL;
  }
  UINT8 *Buffer = nullptr;
  UINT32 Nt = ReadRemainder(SockFd, Remainder, Details, &Buffer);
  if (Nt != SMB2_NT_SUCCESS) {
    return Nt;
  }
  const UINT8 *Message = Buffer + Start;
  UINT32 Length = Response->SecurityBufferLength;
  if (Length < sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE)) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Challenge message of %d bytes is truncated!\n", __func__,
            __LINE__, Length);
    FreePool(Buffer);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Flags = SMB2ReadLe32(Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, NegotiateFlags));
  UINT16 InfoMaxLen =
      SMB2ReadLe16(Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetInfoFields) + 2);
  if ((Flags & NTLMSSP_NEGOTIATE_TARGET_INFO) == 0 || InfoMaxLen == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, TargetInfo.MaximumLength is zero length!\n",
            __func__, __LINE__);
    FreePool(Buffer);
    return STATUS_INVALID_INFO_CLASS;
  }
  Challenge->Message = Message;
  Challenge->Length = Length;
  Status = SMB2VerifySetupChallengeResponse(Response, Challenge, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifySetupChallengeResponse failed!", Status);
    Challenge->Message = nullptr;
    Challenge->Length = 0;
    Details->ChallAttributes = nullptr;
    FreePool(Buffer);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  *Body = Buffer;
  return SMB2_NT_SUCCESS;
}

EFI_STATUS SMB2VerifySetupChallengeResponse(const SMB2_SESSION_SETUP_RESPONSE *Response,
                                            const SMB2_NTLM_CHALLENGE *Challenge,
                                            TRANSACT_DETAILS *Details) {
  if (Response == nullptr || Challenge == nullptr || Challenge->Message == nullptr ||
      Details == nullptr || Challenge->Length < sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE)) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  const UINT8 *Msg = Challenge->Message;
  if (Response->Header.Status != STATUS_MORE_PROCESSING_REQUIRED) {
    Smb2Log(DIAG_ALWAYS, "Session Status is incorrect! Status = 0x%x\n", Response->Header.Status);
    return EFI_SECURITY_VIOLATION;
  }
  if (Response->Header.MessageId != kFirstSetupMessageId) {
    Smb2Log(DIAG_ALWAYS, "Session Message Id is incorrect! Id = 0x%x, Expected = 0x%x\n",
            static_cast<UINT32>(Response->Header.MessageId),
            static_cast<UINT32>(kFirstSetupMessageId));
    return EFI_SECURITY_VIOLATION;
  }
  if (CompareMem(Msg, NTLMSSP_SIGNATURE, sizeof(NTLMSSP_SIGNATURE)) != 0) {
    Smb2Log(DIAG_ALWAYS, "Session Message type is incorrect! Signature = %c%c%c%c%c%c%c%c\n",
            Msg[0], Msg[1], Msg[2], Msg[3], Msg[4], Msg[5], Msg[6], Msg[7]);
    return EFI_SECURITY_VIOLATION;
  }
  UINT32 Type = SMB2ReadLe32(Msg + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, MessageType));
  if (Type != NTLMSSP_CHALLENGE_MESSAGE_TYPE) {
    Smb2Log(DIAG_ALWAYS, "Session Message type is incorrect! Type = 0x%x\n", Type);
    return EFI_SECURITY_VIOLATION;
  }
  Details->SessionId = Response->Header.SessionId;
  Smb2Log(DIAG_VERBOSE, "TransactDetails->SessionId = 0x%x\n",
          static_cast<UINT32>(Details->SessionId));
  return SMB2NTLMExtractChallenge(Challenge, Details);
}

EFI_STATUS SMB2NTLMSSPAuthenticatePacketConstruct(const SMB2_NTLM_CHALLENGE *Challenge,
                                                  TRANSACT_DETAILS *Details, UINT8 **Packet,
                                                  UINT32 *Total) {
  UINT8 *Blob = nullptr;
  UINT16 BlobLength = 0;
  EFI_STATUS Status = SMB2NTLMAuthenticateBlobConstruct(Challenge, Details, &Blob, &BlobLength);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Status = SMB2SessionSetupPacketConstruct(Blob, BlobLength, Details, Packet, Total);
  ZeroMem(Blob, BlobLength);
  FreePool(Blob);
  return Status;
}

UINT32 SMB2SessionNTLMRequest(INT32 SockFd, const SMB2_NTLM_CHALLENGE *Challenge,
                              TRANSACT_DETAILS *Details) {
  if (Challenge == nullptr || Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  UINT8 *Packet = nullptr;
  UINT32 Total = 0;
  EFI_STATUS Status = SMB2NTLMSSPAuthenticatePacketConstruct(Challenge, Details, &Packet, &Total);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NTLMSSPAuthenticatePacketConstruct failed!", Status);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  return SMB2SendVerdict(SMB2SendAndFree(SockFd, Packet, Total, &Details->TransportStatus));
}

EFI_STATUS SMB2VerifySetupResponse(const SMB2_HEADER *Header, TRANSACT_DETAILS *Details) {
  if (Header == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  if (Header->Status == STATUS_LOGON_FAILURE) {
    Smb2Log(DIAG_ALWAYS, "Session Status Logon failed! Status = 0x%x\n", Header->Status);
    return EFI_SECURITY_VIOLATION;
  }
  if (Header->Status != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS, "Session Status is incorrect! Status = 0x%x\n", Header->Status);
    return EFI_PROTOCOL_ERROR;
  }
  if (Header->MessageId != Details->MessageId) {
    Smb2Log(DIAG_ALWAYS, "Session Message Id is incorrect! Id = 0x%x, Expected = 0x%x\n",
            static_cast<UINT32>(Header->MessageId), static_cast<UINT32>(Details->MessageId));
    return EFI_SECURITY_VIOLATION;
  }
  Smb2Log(DIAG_VERBOSE, "SMB2VerifySetupResponse returned success!\n");
  return EFI_SUCCESS;
}

UINT32 SMB2SessionSetupResponse(INT32 SockFd, TRANSACT_DETAILS *Details) {
  if (Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  SMB2_SESSION_SETUP_RESPONSE Response;
  UINT32 Nt = STATUS_UNSUCCESSFUL;
  EFI_STATUS Status = SMB2ReadVerifyHeader(&Response.Header, Details, SockFd, &Nt);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2ReadVerifyHeader failed!", Status);
    return Nt;
  }
  UINT32 StreamLength = SMB2StreamLength(&Response.Header);
  UINT32 Start = 0;
  UINT8 *Rest = nullptr;
  if (StreamLength < kSetupFixedEnd) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Response length 0x%x is too short!\n",
            __func__, __LINE__, StreamLength);
    SMB2DrainBytes(SockFd, SMB2BodyLength(&Response.Header), Details);
    Nt = STATUS_UNSUCCESSFUL;
  } else if (SMB2ReceiveAll(SockFd, reinterpret_cast<UINT8 *>(&Response) + sizeof(SMB2_HEADER),
                            kSetupFixedEnd - SMB2_HEADER_STRUCTURE_SIZE, Details) != 0) {
    SMB2PrintReceiveFailure(Details->TransportStatus);
    Nt = STATUS_UNSUCCESSFUL;
  } else if (!LocateSecurityBuffer(&Response, StreamLength, &Start)) {
    SMB2DrainBytes(SockFd, StreamLength - kSetupFixedEnd, Details);
    Nt = STATUS_UNSUCCESSFUL;
  } else {
    // The security buffer (and anything after it) is read but not
    // interpreted.
    Nt = ReadRemainder(SockFd, StreamLength - kSetupFixedEnd, Details, &Rest);
    if (Nt == SMB2_NT_SUCCESS) {
      if (Response.SecurityBufferLength != 0) {
        Smb2Log(DIAG_VERBOSE, "TCP_PollAndReceiveMessage succeeded!\n");
      } else {
        Smb2Log(DIAG_VERBOSE, "SecurityBufferLength is zero!\n");
      }
      Status = SMB2VerifySetupResponse(&Response.Header, Details);
      if (Status == EFI_SECURITY_VIOLATION) {
        DiagError("SMB2VerifySetupResponse logon failed!", Status);
        Nt = STATUS_LOGON_FAILURE;
      } else if (EFI_ERROR(Status)) {
        DiagError("SMB2VerifySetupResponse failed!", Status);
        Nt = STATUS_UNSUCCESSFUL;
      }
    }
  }
  FreePool(Rest);
  Smb2Log(DIAG_TRACE, "Exiting %s, Status = 0x%lx\n", __func__, static_cast<UINT64>(Nt));
  return Nt;
}

EFI_STATUS SMB2SessionSetUp(INT32 SockFd, SMB2_SESSION_SETUP_RESPONSE *Response,
                            TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  if (Response == nullptr || Details == nullptr) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Parameter!\n", __func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status =
      SMB2MapNtStatus(SMB2SessionSetupRequest(SockFd, Details), "SMB2SessionSetupRequest");
  if (EFI_ERROR(Status)) {
    return Status;
  }
  UINT8 *Body = nullptr;
  SMB2_NTLM_CHALLENGE Challenge;
  ZeroMem(&Challenge, sizeof(Challenge));
  Status =
      SMB2MapNtStatus(SMB2SessionChallengeResponse(SockFd, Response, Details, &Body, &Challenge),
                      "SMB2SessionChallengeResponse");
  if (EFI_ERROR(Status)) {
    return Status;
  }
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.Header.Status = 0x%x\n", Response->Header.Status);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.Header.CreditRequest = 0x%x\n",
          Response->Header.CreditRequest);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.StrutureSize = 0x%x\n", Response->StructureSize);
  Smb2Log(DIAG_VERBOSE, "SessionSetupResp.SecurityBufferLength = 0x%x\n",
          Response->SecurityBufferLength);
  Smb2Log(DIAG_VERBOSE, "NTLMChallengeMessage->Signature = %s\n",
          reinterpret_cast<const CHAR8 *>(Challenge.Message));
  Smb2Log(DIAG_VERBOSE, "NTLMChallengeMessage->MessageType = 0x%x\n",
          SMB2ReadLe32(Challenge.Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, MessageType)));

  Details->MessageId++;
  Status = SMB2MapNtStatus(SMB2SessionNTLMRequest(SockFd, &Challenge, Details),
                           "SMB2SessionNTLMRequest");
  // The challenge is not needed past the AUTHENTICATE; ChallAttributes
  // pointed into it.
  Details->ChallAttributes = nullptr;
  FreePool(Body);
  if (!EFI_ERROR(Status)) {
    Status = SMB2MapNtStatus(SMB2SessionSetupResponse(SockFd, Details), "SMB2SessionSetupResponse");
  }
  if (!EFI_ERROR(Status)) {
    SMB2ConnectionState = SMB2_STATE_SESSION;
  }
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
