// SMB2 NEGOTIATE: connect to the server's SMB port, offer dialects 2.0.2 and
// 2.1, and adopt what the server announces.
#include "smb2/SMB2Negotiate.h"

#include "DiagLog.h"
#include "NwBaseLib.h"
#include "smb2/TcpTransport.h"

namespace {

constexpr UINT32 kNegotiateBodyFixed = sizeof(SMB2_NEGOTIATE_RESPONSE) - SMB2_FRAMED_HEADER_SIZE;

void PrintInvalidParameter(const CHAR8 *Function, UINT32 Line) {
  Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Parameter!\n", Function, Line);
}

void PrintNegotiateResponse(const SMB2_NEGOTIATE_RESPONSE *Resp, UINT32 MessageLength) {
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
  // The security buffer is only shown, never parsed; its offset counts from
  // the SMB2 header, which sits behind the 4-byte prefix.
  UINT64 Start = static_cast<UINT64>(Resp->SecurityBufferOffset) + SMB2_STREAM_PREFIX_SIZE;
  UINT64 End = Start + Resp->SecurityBufferLength;
  if (Resp->SecurityBufferLength == 0 || Start < sizeof(SMB2_NEGOTIATE_RESPONSE) ||
      End > MessageLength) {
    Smb2Log(DIAG_VERBOSE, "NegotiateResp->SecurityBuffer is not within the response\n");
    return;
  }
  const UINT8 *Bytes = reinterpret_cast<const UINT8 *>(Resp);
  for (UINT64 I = Start; I < End; I++) {
    Smb2Log(DIAG_DUMP, "Buffer[%d] = %d\n", static_cast<UINT32>(I - Start), Bytes[I]);
  }
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

EFI_STATUS SMB2NegotiateConnect(const CHAR8 *IpAddress, INT32 *SockFd, TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  if (IpAddress == nullptr || SockFd == nullptr || Details == nullptr) {
    PrintInvalidParameter(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  NwSockAddrIn Addr4;
  NwSockAddrIn6 Addr6;
  ZeroMem(&Addr4, sizeof(Addr4));
  ZeroMem(&Addr6, sizeof(Addr6));
  INT32 Domain = 0;
  INT32 TcpStatus =
      TCP_GetDomainTypeByIPAddress(IpAddress, &Domain, SMB2_SERVER_PORT, &Addr4, &Addr6);
  if (TcpStatus != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP_GetDomainTypeByIPAddress failed! Status = 0x%x "
            "(%d)\n",
            __func__, __LINE__, TcpStatus, TcpStatus);
    return EFI_DEVICE_ERROR;
  }
  Smb2Log(DIAG_VERBOSE, "Domain = %d\n", Domain);
  INT32 Fd = 0;
  TcpStatus = TCP_CreateSocket(&Fd, Domain);
  if (TcpStatus != 0) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, TCP socket failed! TCP_Status = 0x%x (%d)\n", __func__,
            __LINE__, TcpStatus, TcpStatus);
    return EFI_DEVICE_ERROR;
  }
  Smb2Log(DIAG_VERBOSE, "SockFd = %d\n", Fd);
  gSMB2SockFd = Fd;
  *SockFd = Fd;

  // TCP_Connect gets the keep-alive option prepared but its flag off, so no
  // option is set.
  constexpr INT32 kOptionLevel = NW_SOL_SOCKET;
  constexpr INT32 kOptionName = 0x200;
  constexpr INT32 kOptionValue = 1;
  CHAR8 *Formatted = Details->ShareDetails.FormattedAddress;
  if (Domain == NW_AF_INET) {
    Smb2Log(DIAG_VERBOSE, "SocketAddr.sin_family = %d\n", Addr4.sin_family);
    Smb2Log(DIAG_VERBOSE, "SocketAddr.sin_port = %d\n", Addr4.sin_port);
    AsciiSPrint(Formatted, SMB2_FORMATTED_ADDRESS_FIELD, "%pI4", Addr4.sin_addr);
    TcpStatus = TCP_Connect(Fd, 0, kOptionLevel, kOptionName, kOptionValue, &Addr4, sizeof(Addr4));
  } else if (Domain == NW_AF_INET6) {
    Smb2Log(DIAG_VERBOSE, "SocketAddr6.sin_family = %d\n", Addr6.sin6_family);
    Smb2Log(DIAG_VERBOSE, "SocketAddr6.sin_port = %d\n", Addr6.sin6_port);
    AsciiSPrint(Formatted, SMB2_FORMATTED_ADDRESS_FIELD, "%pI6", Addr6.sin6_addr);
    TcpStatus = TCP_Connect(Fd, 0, kOptionLevel, kOptionName, kOptionValue, &Addr6, sizeof(Addr6));
  } else {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, Invalid Domain %d\n", __func__, __LINE__,
            Domain);
    return EFI_UNSUPPORTED;
  }
  EFI_STATUS Status = TcpStatus == -1 ? EFI_DEVICE_ERROR : EFI_SUCCESS;
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}

EFI_STATUS SMB2NegotiatePacketConstruct(SMB2_NEGOTIATE_REQUEST *Request) {
  EFI_STATUS Status = SMB2HeaderConstruct(Request);
  if (EFI_ERROR(Status)) {
    return Status;
  }
  ZeroMem(reinterpret_cast<UINT8 *>(Request) + sizeof(SMB2_HEADER),
          sizeof(*Request) - sizeof(SMB2_HEADER));
  SMB2HeaderFill(&Request->Header, SMB2_NEGOTIATE, sizeof(*Request), &TransactDetails);
  Request->StructureSize = SMB2_NEGOTIATE_STRUCTURE_SIZE;
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

UINT32 SMB2NegotiateRequest(SMB2_NEGOTIATE_REQUEST *Request, UINT32 *TransportStatus,
                            INT32 SockFd) {
  if (Request == nullptr || TransportStatus == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  if (EFI_ERROR(SMB2NegotiatePacketConstruct(Request))) {
    Smb2Log(DIAG_ALWAYS, "Function: %s, Line no.: = %d, SMB2NegotiatePacketConstruct failed!\n",
            __func__, __LINE__);
    return STATUS_UNSUCCESSFUL;
  }
  return SMB2SendVerdict(SMB2SendRequest(SockFd, Request, sizeof(*Request), TransportStatus));
}

UINT32 SMB2NegotiateResponse(SMB2_NEGOTIATE_RESPONSE **Response, TRANSACT_DETAILS *Details,
                             INT32 SockFd) {
  if (Response == nullptr || Details == nullptr) {
    DiagNullInput();
    return SMB2_NT_INVALID_PARAMETER;
  }
  *Response = nullptr;
  SMB2_HEADER Header;
  INT32 Rx = SMB2ReceiveAll(SockFd, &Header, sizeof(Header), Details);
  if (Rx != 0) {
    SMB2PrintReceiveFailure(static_cast<UINT32>(Rx));
    return static_cast<UINT32>(Rx);
  }
  UINT32 BodyLength = SMB2BodyLength(&Header);
  EFI_STATUS Status = SMB2VerifyHeader(&Header, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifyHeader failed!", Status);
    Smb2Log(DIAG_VERBOSE, "Negotiation response header check failed!\n");
    Smb2Log(DIAG_VERBOSE, "ReadResp->Header.StreamProtocolLength = 0x%x (%ld)\n",
            SMB2StreamLength(&Header), static_cast<INT64>(SMB2StreamLength(&Header)));
    UINT64 Drained = 0;
    UINT32 Drain = SMB2DrainRefused(SockFd, &Header, 0, Details, &Drained);
    if (Drained < BodyLength) {
      Smb2Log(DIAG_VERBOSE, "ReadDataSize = %ld, BytesRead = %ld\n", static_cast<INT64>(BodyLength),
              static_cast<INT64>(Drained));
    }
    return Drain == STATUS_NO_MEMORY ? STATUS_NO_MEMORY : STATUS_UNSUCCESSFUL;
  }
  Smb2Log(DIAG_VERBOSE, "Negotiation Response header successfully verified!\n");
  Smb2Log(DIAG_VERBOSE, "ReadDataSize: 0x%x\n", BodyLength);
  if (BodyLength < kNegotiateBodyFixed || BodyLength > SMB2_MAX_BUFFERED_BODY) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, Negotiate response length 0x%x is invalid!\n", __func__,
            __LINE__, BodyLength);
    SMB2DrainBytes(SockFd, BodyLength, Details);
    return STATUS_UNSUCCESSFUL;
  }
  UINT32 MessageLength = SMB2_FRAMED_HEADER_SIZE + BodyLength;
  UINT8 *Buffer = static_cast<UINT8 *>(AllocateZeroPool(MessageLength + 1));
  if (Buffer == nullptr) {
    SMB2PrintAllocFailure();
    return STATUS_NO_MEMORY;
  }
  CopyMem(Buffer, &Header, sizeof(Header));
  if (SMB2ReceiveAll(SockFd, Buffer + SMB2_FRAMED_HEADER_SIZE, BodyLength, Details) != 0) {
    SMB2PrintReceiveFailure(Details->TransportStatus);
    FreePool(Buffer);
    return STATUS_UNSUCCESSFUL;
  }
  *Response = reinterpret_cast<SMB2_NEGOTIATE_RESPONSE *>(Buffer);
  PrintNegotiateResponse(*Response, MessageLength);
  return SMB2_NT_SUCCESS;
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
  Details->MaxTransactSize = Response->MaxTransactSize;
  Details->MaxReadSize = Response->MaxReadSize;
  Details->MaxWriteSize = Response->MaxWriteSize;
  Details->ServerCapabilities = Response->Capabilities;
  Details->SecurityBufferOffset = Response->SecurityBufferOffset;
  Details->SecurityBufferLength = Response->SecurityBufferLength;
  return EFI_SUCCESS;
}

EFI_STATUS SMB2Negotiate(const CHAR8 *IpAddress, SMB2_NEGOTIATE_REQUEST *Request, INT32 *SockFd,
                         TRANSACT_DETAILS *Details) {
  DiagEntry(DiagChannel::Smb2);
  if (IpAddress == nullptr || Request == nullptr || Details == nullptr || SockFd == nullptr) {
    PrintInvalidParameter(__func__, __LINE__);
    return EFI_INVALID_PARAMETER;
  }
  EFI_STATUS Status = SMB2NegotiateConnect(IpAddress, SockFd, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2NegotiateConnect failed!", Status);
    return Status;
  }
  Smb2Log(DIAG_VERBOSE, "SockFd = %d\n", *SockFd);

  UINT32 Nt = SMB2NegotiateRequest(Request, &Details->TransportStatus, *SockFd);
  if (Nt != SMB2_NT_SUCCESS) {
    return Nt == SMB2_NT_INVALID_PARAMETER ? EFI_INVALID_PARAMETER : EFI_DEVICE_ERROR;
  }
  SMB2_NEGOTIATE_RESPONSE *Response = nullptr;
  Nt = SMB2NegotiateResponse(&Response, Details, *SockFd);
  if (Nt != SMB2_NT_SUCCESS) {
    Smb2Log(DIAG_ALWAYS,
            "Function: %s, Line no.: = %d, SMB2NegotiateResponse failed! 0x%x (%d), TCP status = "
            "%d\n",
            __func__, __LINE__, Nt, Nt, Details->TransportStatus);
    return EFI_PROTOCOL_ERROR;
  }
  Details->DialectRevision = Request->Dialects[1];
  Details->SecurityMode = static_cast<UINT8>(Request->SecurityMode);
  Details->CreditRequest = Request->Header.CreditRequest;

  Status = SMB2VerifyExtractNegotiateResponse(Response, Details);
  if (EFI_ERROR(Status)) {
    DiagError("SMB2VerifyExtractNegotiateResponse failed!", Status);
  } else {
    Smb2Log(DIAG_VERBOSE, "TransactDetails.DialectRevision = 0x%x\n", Details->DialectRevision);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.CreditRequest = 0x%x\n", Details->CreditRequest);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxTransactSize = 0x%x\n", Details->MaxTransactSize);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxReadSize = 0x%x\n", Details->MaxReadSize);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.MaxWriteSize = 0x%x\n", Details->MaxWriteSize);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.Flags = 0x%x\n", Details->Flags);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.SecurityMode = 0x%x\n", Details->SecurityMode);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.Capabilities = 0x%x\n", Details->Capabilities);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.Channel = 0x%x\n", Details->Channel);
    Smb2Log(DIAG_VERBOSE, "TransactDetails.SecurityBufferLength = 0x%x\n",
            Details->SecurityBufferLength);
  }
  FreePool(Response);
  DiagExit(Status, DiagChannel::Smb2);
  return Status;
}
