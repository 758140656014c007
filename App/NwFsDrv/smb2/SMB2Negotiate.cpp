// SMB2 NEGOTIATE: offer dialects 2.0.2 and 2.1 and adopt what the server
// announces. The encoder and the decoder of the exchange.
#include "smb2/SMB2Negotiate.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/SMB2Signing.h"

namespace {

constexpr UINT32 kNegotiateBodyFixed = sizeof(SMB2_NEGOTIATE_RESPONSE) - SMB2_FRAMED_HEADER_SIZE;

void PrintNegotiateResponse(const SMB2_NEGOTIATE_RESPONSE *Resp, const SMB2_RESPONSE *Answer) {
  if (!DiagEnabled(DiagChannel::Smb2, DIAG_VERBOSE)) {
    return;
  }
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->StructureSize: 0x%x\n", Resp->StructureSize);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->SecurityMode: 0x%x\n", Resp->SecurityMode);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->DialectRevision: 0x%x\n", Resp->DialectRevision);
  for (UINT32 I = 0; I < sizeof(Resp->ServerGuid); I++) {
    Smb2Log(DIAG_VERBOSE, "NegotiateResp->ServerGUID[%d]: 0x%x\n", I, Resp->ServerGuid[I]);
  }
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->Capabilities: 0x%x\n", Resp->Capabilities);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->MaxTransactSize: 0x%x\n", Resp->MaxTransactSize);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->MaxReadSize: 0x%x\n", Resp->MaxReadSize);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->MaxWriteSize: 0x%x\n", Resp->MaxWriteSize);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->SystemTime: 0x%lx\n",
          static_cast<UINT64>(Resp->SystemTime));
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->ServerStartTime: 0x%lx\n",
          static_cast<UINT64>(Resp->ServerStartTime));
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->SecurityBufferOffset: 0x%x\n", Resp->SecurityBufferOffset);
  Smb2Log(DIAG_VERBOSE, "NegotiateResp->SecurityBufferLength: 0x%x\n", Resp->SecurityBufferLength);
  // The security buffer is only shown, never parsed.
  const UINT8 *Bytes =
      SMB2ResponseRange(Answer, Resp->SecurityBufferOffset, Resp->SecurityBufferLength);
  if (Resp->SecurityBufferLength == 0 || Bytes == nullptr) {
    Smb2Log(DIAG_VERBOSE, "NegotiateResp->SecurityBuffer is not within the response\n");
    return;
  }
  for (UINT32 I = 0; I < Resp->SecurityBufferLength; I++) {
    Smb2Log(DIAG_DUMP, "Buffer[%d] = %d\n", I, Bytes[I]);
  }
}

UINT32 EncodeNegotiate(void *Context, TRANSACT_DETAILS *Details, SMB2_REQUEST *Request) {
  (void)Details;
  SMB2_NEGOTIATE_REQUEST *Packet = static_cast<SMB2_NEGOTIATE_CONTEXT *>(Context)->Request;
  if (EFI_ERROR(SMB2NegotiatePacketConstruct(Packet))) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, SMB2NegotiatePacketConstruct failed!\n",
            "SMB2NegotiateRequest", __LINE__);
    return STATUS_UNSUCCESSFUL;
  }
  SMB2LayRequest(Request, Packet, sizeof(*Packet), sizeof(*Packet));
  return SMB2_NT_SUCCESS;
}

UINT32 DecodeNegotiate(void *Context, const SMB2_RESPONSE *Answer) {
  SMB2_NEGOTIATE_CONTEXT *Negotiate = static_cast<SMB2_NEGOTIATE_CONTEXT *>(Context);
  Smb2Log(DIAG_VERBOSE, "Negotiation Response header successfully verified!\n");
  Smb2Log(DIAG_VERBOSE, "ReadDataSize: 0x%x\n", Answer->BodyLength);
  SMB2_NEGOTIATE_RESPONSE Response;
  CopyMem(&Response.Header, &Answer->Header, sizeof(Response.Header));
  CopyMem(reinterpret_cast<UINT8 *>(&Response) + sizeof(SMB2_HEADER), Answer->Fixed,
          kNegotiateBodyFixed);
  PrintNegotiateResponse(&Response, Answer);
  // The record starts from what was offered, then adopts the answer.
  const SMB2_NEGOTIATE_REQUEST *Offer = Negotiate->Request;
  TransactDetails.DialectRevision = Offer->Dialects[1];
  TransactDetails.SecurityMode = static_cast<UINT8>(Offer->SecurityMode);
  TransactDetails.CreditRequest = Offer->Header.CreditRequest;
  Negotiate->Verdict = SMB2VerifyExtractNegotiateResponse(&Response, &TransactDetails);
  if (EFI_ERROR(Negotiate->Verdict)) {
    return STATUS_UNSUCCESSFUL;
  }
  SMB2SigningDecide(Response.SecurityMode);
  return SMB2_NT_SUCCESS;
}

} // namespace

EFI_STATUS SMB2VerifyDialect(UINT16 Dialect) {
  Smb2Log(DIAG_VERBOSE, "DialectReceived = 0x%x\n", Dialect);
  switch (Dialect) {
  case SMB2_DIALECT_202:
  case SMB2_DIALECT_210:
    Smb2Log(DIAG_VERBOSE, "Supported dialect 0x%x detected!\n", Dialect);
    return EFI_SUCCESS;
  case SMB2_DIALECT_WILDCARD:
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Wildcard dialect 0x%x detected! It is unsupported at "
            "the moment!\n",
            __func__, __LINE__, Dialect);
    return EFI_UNSUPPORTED;
  case SMB2_DIALECT_300:
  case SMB2_DIALECT_302:
  case SMB2_DIALECT_311:
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Unsupported dialect 0x%x detected! \n",
            __func__, __LINE__, Dialect);
    return EFI_UNSUPPORTED;
  default:
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Unrecognized dialect 0x%x detected! \n",
            __func__, __LINE__, Dialect);
    return EFI_NOT_FOUND;
  }
}

EFI_STATUS SMB2NegotiatePacketConstruct(SMB2_NEGOTIATE_REQUEST *Request) {
  EFI_STATUS Status = SMB2HeaderConstruct(Request);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  ZeroMem(reinterpret_cast<UINT8 *>(Request) + sizeof(SMB2_HEADER),
          sizeof(*Request) - sizeof(SMB2_HEADER));
  Request->StructureSize = SMB2_REQUEST_STRUCTURE_SIZE[SMB2_NEGOTIATE];
  Request->DialectCount = 2;
  Request->SecurityMode = 1;
  Request->Capabilities = 0;
  CopyMem(Request->ClientGuid, SMB2_CLIENT_GUID, sizeof(SMB2_CLIENT_GUID));
  Request->ClientStartTime = 0;
  Request->Dialects[0] = SMB2_DIALECT_202;
  Request->Dialects[1] = SMB2_DIALECT_210;
  Smb2Log(DIAG_VERBOSE, "SMB2_REQUEST_STRUCTURE_SIZE[SMB2_NEGOTIATE] = 0x%x\n",
          Request->StructureSize);
  return EFI_SUCCESS;
}

EFI_STATUS SMB2VerifyExtractNegotiateResponse(const SMB2_NEGOTIATE_RESPONSE *Response,
                                              TRANSACT_DETAILS *Details) {
  if (Response == nullptr || Details == nullptr) {
    if (Response == nullptr) {
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, NegotiateResp is NULL!\n", __func__,
              __LINE__);
    } else {
      Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, TransactDetails is NULL!\n", __func__,
              __LINE__);
    }
    DiagNullInput();
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = SMB2VerifyDialect(Response->DialectRevision);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifyDialect check failed!", Status);
    return Status;
  }
  Details->DialectRevision = Response->DialectRevision;
  if (Response->Header.CreditRequest != Details->CreditRequest) {
    Smb2Log(DIAG_VERBOSE, "Changing CreditRequest from 0x%x to 0x%x as per the response.\n",
            Details->CreditRequest, Response->Header.CreditRequest);
    Details->CreditRequest = Response->Header.CreditRequest;
  }
  if (Response->SecurityMode != Details->SecurityMode) {
    Smb2Log(DIAG_VERBOSE, "Changing SecurityMode from 0x%x to 0x%x as per the response.\n",
            Details->SecurityMode, Response->SecurityMode);
    Details->SecurityMode = static_cast<UINT8>(Response->SecurityMode);
  }
  // A server must be able to carry file data: transfers shrink to smaller
  // maximum sizes, but one too small for any useful transfer is refused.
  if (Response->MaxReadSize < SMB2_MIN_TRANSFER_SIZE ||
      Response->MaxWriteSize < SMB2_MIN_TRANSFER_SIZE) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, MaxReadSize 0x%x or MaxWriteSize 0x%x is below the "
            "0x%x bytes a transfer needs!\n",
            __func__, __LINE__, Response->MaxReadSize, Response->MaxWriteSize,
            SMB2_MIN_TRANSFER_SIZE);
    return EFI_PROTOCOL_ERROR;
  }
  Details->MaxTransactSize = Response->MaxTransactSize;
  Details->MaxReadSize = Response->MaxReadSize;
  Details->MaxWriteSize = Response->MaxWriteSize;
  Details->ServerCapabilities = Response->Capabilities;
  Details->SecurityBufferOffset = Response->SecurityBufferOffset;
  Details->SecurityBufferLength = Response->SecurityBufferLength;
  return EFI_SUCCESS;
}

namespace {

const SMB2_RECEIVE_TEXTS kNegotiateTexts = {
    nullptr,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n",
    "Negotiation response header check failed!\n",
    DIAG_VERBOSE,
    "Function: %s, Line no.: = %d, TCP_PollAndReceiveMessage failed! Status = 0x%x\n",
    false,
    nullptr,
};

} // namespace

const SMB2_COMMAND gSMB2NegotiateCommand = {
    SMB2_NEGOTIATE,
    SMB2_COMMAND_SESSION_CODES,
    kNegotiateBodyFixed,
    SMB2_MAX_BUFFERED_BODY,
    "SMB2NegotiateRequest",
    "SMB2NegotiateResponse",
    nullptr,
    &kNegotiateTexts,
    EncodeNegotiate,
    nullptr,
    DecodeNegotiate,
};
