// SESSION_SETUP: the first leg carries the NTLMSSP NEGOTIATE and must be
// answered with STATUS_MORE_PROCESSING_REQUIRED and a CHALLENGE; the second
// carries the AUTHENTICATE and must be answered with success. The tokens
// travel raw in the security buffer, without SPNEGO. The encoders and
// decoders of the two exchanges.
#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Session.h"
#include "smb2/SMB2Signing.h"

namespace {

// The answer's fixed part: StructureSize, SessionFlags, SecurityBufferOffset
// and SecurityBufferLength.
constexpr UINT16 kSetupFixed = sizeof(SMB2_SESSION_SETUP_RESPONSE) - SMB2_FRAMED_HEADER_SIZE;
constexpr UINT64 kFirstSetupMessageId = 1;

SMB2_SESSION_CONTEXT *SessionOf(void *Context) {
  return static_cast<SMB2_SESSION_CONTEXT *>(Context);
}

// The answer's header and fixed part as one record.
void TakeFixedPart(const SMB2_RESPONSE *Answer, SMB2_SESSION_SETUP_RESPONSE *Response) {
  CopyMem(&Response->Header, &Answer->Header, sizeof(Response->Header));
  CopyMem(reinterpret_cast<UINT8 *>(Response) + sizeof(SMB2_HEADER), Answer->Fixed, kSetupFixed);
}

// The request around a security blob: the fixed part, then the blob.
UINT32 LaySetup(SMB2_SESSION_CONTEXT *Session, const UINT8 *Blob, UINT16 BlobLength,
                TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  EFI_STATUS Status = SMB2SessionSetupPacketConstruct(&Session->Packet, BlobLength, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2SessionSetupPacketConstruct failed!", Status);
    return STATUS_UNSUCCESSFUL;
  }
  SMB2LayRequest(Request, &Session->Packet, sizeof(Session->Packet),
                 sizeof(Session->Packet) + BlobLength);
  SMB2AddPiece(Request, Blob, BlobLength);
  return SMB2_NT_SUCCESS;
}

// Where the security buffer of an answer lies; false (and a line) when it
// does not lie within the answer as announced.
bool LocateSecurityBuffer(const SMB2_SESSION_SETUP_RESPONSE *Response, const SMB2_RESPONSE *Answer,
                          const CHAR8 *Function) {
  UINT64 Offset = Response->SecurityBufferOffset;
  UINT64 Length = Response->SecurityBufferLength;
  UINT64 FixedEnd = SMB2_HEADER_STRUCTURE_SIZE + kSetupFixed;
  if (Length == 0 || (Offset >= FixedEnd &&
                      Offset + Length <= FixedEnd + Answer->BodyLength - Answer->FixedLength)) {
    return true;
  }
  Smb2Log(DIAG_ALWAYS,
          "Function: %s, Line no.: = %d, Security buffer (0x%x, 0x%x) lies outside the response!\n",
          Function, __LINE__, static_cast<UINT32>(Offset), static_cast<UINT32>(Length));
  return false;
}

UINT32 EncodeNegotiateLeg(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_SESSION_CONTEXT *Session = SessionOf(Context);
  UINT16 Length = 0;
  EFI_STATUS Status = SMB2NTLMSSPNegotiatePacketConstruct(Session->Negotiate, &Length);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NTLMSSPNegotiatePacketConstruct failed!", Status);
    DiagError("SMB2SessionSetupPacketConstruct failed!", Status);
    return STATUS_UNSUCCESSFUL;
  }
  return LaySetup(Session, Session->Negotiate, Length, Details, Request);
}

// The CHALLENGE: it must carry target info; a copy of it is kept for the
// AUTHENTICATE.
UINT32 DecodeChallenge(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_SESSION_CONTEXT *Session = SessionOf(Context);
  const CHAR8 *Function = "SMB2SessionChallengeResponse";
  SMB2_SESSION_SETUP_RESPONSE *Response = Session->First;
  TakeFixedPart(Answer, Response);
  if (!LocateSecurityBuffer(Response, Answer, Function)) {
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Length = Response->SecurityBufferLength;
  const UINT8 *Message = SMB2ResponseRange(Answer, Response->SecurityBufferOffset, Length);
  if (Message == nullptr || Length < sizeof(SMB2_NTLMSSP_CHALLENGE_MESSAGE)) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Challenge message of %d bytes is truncated!\n", Function,
            __LINE__, Length);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 Flags = SMB2ReadLe32(Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, NegotiateFlags));
  UINT16 InfoMaxLen =
      SMB2ReadLe16(Message + offsetof(SMB2_NTLMSSP_CHALLENGE_MESSAGE, TargetInfoFields) + 2);
  if ((Flags & NTLMSSP_NEGOTIATE_TARGET_INFO) == 0 || InfoMaxLen == 0) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, TargetInfo.MaximumLength is zero length!\n",
            Function, __LINE__);
    return STATUS_INVALID_INFO_CLASS;
  }
  UINT8 *Copy = static_cast<UINT8 *>(AllocateCopyPool(Length, Message));
  if (Copy == nullptr) {
    SMB2PrintAllocFailure(Function, __LINE__);
    return STATUS_NO_MEMORY;
  }
  Session->Challenge.Message = Copy;
  Session->Challenge.Length = Length;
  EFI_STATUS Status =
      SMB2VerifySetupChallengeResponse(Response, &Session->Challenge, &TransactDetails);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifySetupChallengeResponse failed!", Status, Function, __LINE__);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  return SMB2_NT_SUCCESS;
}

UINT32 EncodeAuthenticateLeg(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  SMB2_SESSION_CONTEXT *Session = SessionOf(Context);
  EFI_STATUS Status = SMB2NTLMAuthenticateBlobConstruct(
      &Session->Challenge, Details, &Session->Authenticate, &Session->AuthenticateLength);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NTLMSSPAuthenticatePacketConstruct failed!", Status, "SMB2SessionNTLMRequest",
              __LINE__);
    return Status == EFI_OUT_OF_RESOURCES ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  return LaySetup(Session, Session->Authenticate, Session->AuthenticateLength, Details, Request);
}

// The final answer: its security buffer is checked for its place but not
// interpreted.
UINT32 DecodeSetupResult(void *Context, const SMB2_RESPONSE *Answer) {
  (void)Context;
  SMB2_SESSION_SETUP_RESPONSE Response;
  TakeFixedPart(Answer, &Response);
  if (!LocateSecurityBuffer(&Response, Answer, "SMB2SessionSetupResponse")) {
    return STATUS_UNSUCCESSFUL;
  }
  if (Response.SecurityBufferLength != 0) {
    Smb2Log(DIAG_VERBOSE, "TCP_PollAndReceiveMessage succeeded!\n");
  } else {
    Smb2Log(DIAG_VERBOSE, "SecurityBufferLength is zero!\n");
  }
  EFI_STATUS Status = SMB2VerifySetupResponse(&Response.Header, &TransactDetails);
  if (Status == EFI_SECURITY_VIOLATION) {
    DiagError("SMB2VerifySetupResponse logon failed!", Status, "SMB2SessionSetupResponse",
              __LINE__);
    return STATUS_LOGON_FAILURE;
  }
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifySetupResponse failed!", Status, "SMB2SessionSetupResponse", __LINE__);
    return STATUS_UNSUCCESSFUL;
  }
  return SMB2_NT_SUCCESS;
}

const SMB2_RECEIVE_TEXTS kSessionNegotiateTexts = {
    nullptr,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n",
    "Function: %s, Line no.: = %d, Session Setup response header check failed!\n",
    DIAG_ALWAYS,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n",
    false,
    nullptr,
};

} // namespace

const SMB2_COMMAND gSMB2SessionNegotiateCommand = {
    SMB2_SESSION_SETUP,
    SMB2_COMMAND_SESSION_CODES,
    kSetupFixed,
    SMB2_MAX_BUFFERED_BODY,
    "SMB2SessionSetupRequest",
    "SMB2SessionChallengeResponse",
    nullptr,
    &kSessionNegotiateTexts,
    EncodeNegotiateLeg,
    nullptr,
    DecodeChallenge,
};

const SMB2_COMMAND gSMB2SessionAuthenticateCommand = {
    SMB2_SESSION_SETUP,
    SMB2_COMMAND_SESSION_CODES,
    kSetupFixed,
    0,
    "SMB2SessionNTLMRequest",
    "SMB2SessionSetupResponse",
    nullptr,
    &gSMB2SessionReceiveTexts,
    EncodeAuthenticateLeg,
    nullptr,
    DecodeSetupResult,
};

EFI_STATUS SMB2SessionSetupPacketConstruct(SMB2_SESSION_SETUP_REQUEST *Packet, UINT16 BlobLength,
                                           TRANSACT_DETAILS *Details) {
  if (Packet == nullptr || Details == nullptr) {
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  Details->SecurityBufferOffset = SMB2_SESSION_SETUP_BUFFER_OFFSET;
  Details->SecurityBufferLength = BlobLength;
  ZeroMem(Packet, sizeof(*Packet));
  SMB2HeaderConstruct(&Packet->Header);
  Packet->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_SESSION_SETUP];
  Packet->Flags = Details->Flags;
  // A client that signs where the server does not require it asks for a
  // session that is signed.
  Packet->SecurityMode = static_cast<UINT8>(
      Details->SecurityMode | (SMB2SigningInUse() ? SMB2_NEGOTIATE_SIGNING_REQUIRED : 0));
  Packet->Capabilities = Details->Capabilities;
  Packet->Channel = Details->Channel;
  Packet->SecurityBufferOffset = Details->SecurityBufferOffset;
  Packet->SecurityBufferLength = Details->SecurityBufferLength;
  Packet->PreviousSessionId = 0;
  Smb2Log(DIAG_VERBOSE, "SMB2_REQUEST_STRUCTURE_SIZE[SMB2_SESSION_SETUP] = 0x%x\n",
          Packet->StructureSize);
  return EFI_SUCCESS;
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
